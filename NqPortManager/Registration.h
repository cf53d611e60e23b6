// What registration writes: the AppID script, a script per class and the type library's keys, run
// against the registry file in either direction.
#pragma once

#include <string>
#include <vector>

#include <nqportmanager/NqPortManager.h>

namespace registry {

struct RegisteredClass {
    const CLSID* clsid;
    const char* name;  // "AdvancedPortManager": ProgIDs NqPortManager.<name>[.1]
};

// The scripts as the module carries them, with their resource numbers: 101 the AppID, 103 to
// 106 the classes (one template, %CLASS% and %CLSID% filled in per class), 1 the type library.
extern const char kAppIdScript[];
extern const char kClassScript[];
extern const char kTypeLibScript[];

// Registering runs the AppID script, the script of each class in order, then the type library's;
// unregistering runs them in the same order the other way. The first failure stops it and gives
// its result (SELFREG_E_CLASS, SELFREG_E_TYPELIB, or E_FAIL when the file cannot be used) with
// the reason in error; the file is then left as it was.
HRESULT UpdateRegistration(bool registering, const std::vector<RegisteredClass>& classes,
                           const std::string& modulePath, const std::string& registryPath,
                           std::string& error);

}  // namespace registry
