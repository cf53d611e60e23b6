// nqpm as the module's client: the module loaded as a softphone loads it, objects created through
// its class factories, the module's message loop served from nqpm's own (which also ends on
// Ctrl-C and SIGTERM), and the module's log lines on stderr.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include <nqportmanager/NqPortManager.h>
#include <nqportmanager/client.h>

#include "tools/nqpm/Cli.h"

namespace nqpm {

// What nqpm's --log-level and --log-folder ask of a logger.
struct LogSettings {
    std::optional<int> level;
    std::optional<std::string> folder;
};

// The settings of nqpm's own --log-level and --log-folder.
LogSettings LogSettingsOf(const Options& options);

class ModuleClient {
  public:
    // modulePath, else the module registered for the port manager's class, else the one
    // installed beside nqpm (../lib/libNqPortManager.so). Throws std::runtime_error when none
    // can be loaded.
    explicit ModuleClient(const std::string& modulePath);

    HRESULT Create(REFCLSID clsid, REFIID riid, void** ppv) const;
    HRESULT LoadTypeLibrary(ITypeLib** library) const { return m_module.LoadTypeLibrary(library); }
    // nqpm's loop, serving the module's queue too, until done(), the timeout (-1: none) or an
    // interrupt. Returns done().
    bool RunUntil(const std::function<bool()>& done, int timeoutMs) const;
    // The module's logger, through INqDiagnostics of one of its objects: at the level, into the
    // folder, every line also on stderr. Nothing when neither is set.
    void ConfigureLogging(const LogSettings& settings, IUnknown* object) const;

    const std::string& Path() const { return m_module.Path(); }

  private:
    nqportmanager::Module m_module;
};

// The module installed beside the running nqpm.
std::string ModuleBesideNqpm();

}  // namespace nqpm
