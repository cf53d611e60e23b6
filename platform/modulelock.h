// The module's lock count: its live objects plus the server locks of its class factories. While
// it is above zero a client must not unload the module.
#pragma once

namespace platform {

long ModuleLockCount();
void LockModule();
void UnlockModule();

// Held by every COM object of the module for its lifetime.
class ModuleReference {
  public:
    ModuleReference() { LockModule(); }
    ModuleReference(const ModuleReference&) { LockModule(); }
    ModuleReference& operator=(const ModuleReference&) = default;
    ~ModuleReference() { UnlockModule(); }
};

}  // namespace platform
