#include "tools/nqpm/ModuleClient.h"

#include <cstdio>
#include <stdexcept>

#include "platform/message.h"
#include "platform/module.h"

namespace nqpm {

std::string ModuleBesideNqpm() {
    const std::string self =
        platform::ModuleFilePath(reinterpret_cast<const void*>(&ModuleBesideNqpm));
    return self.substr(0, self.find_last_of('/') + 1) + "../lib/libNqPortManager.so";
}

ModuleClient::ModuleClient(const std::string& modulePath) {
    std::string error;
    const HRESULT hr = modulePath.empty()
                           ? nqportmanager::Module::LoadForClass(
                                 CLSID_AdvancedPortManager, ModuleBesideNqpm(), m_module, &error)
                           : nqportmanager::Module::Load(modulePath, m_module, &error);
    if (FAILED(hr)) {
        throw std::runtime_error("cannot load the module: " + error);
    }
}

HRESULT ModuleClient::Create(REFCLSID clsid, REFIID riid, void** ppv) const {
    return m_module.CreateInstance(clsid, nullptr, riid, ppv);
}

bool ModuleClient::RunUntil(const std::function<bool()>& done, int timeoutMs) const {
    platform::WatchInMessageLoop(m_module.MessageQueueDescriptor());
    return platform::RunMessageLoopUntil(
        [&] {
            m_module.PumpPendingMessages();
            return done();
        },
        timeoutMs);
}

void ModuleClient::ConfigureLogging(const LogSettings& settings, IUnknown* object) const {
    if (!settings.level && !settings.folder) {
        return;
    }
    ComPtr<INqDiagnostics> diagnostics;
    if (object == nullptr ||
        FAILED(object->QueryInterface(IID_INqDiagnostics, diagnostics.GetVoidAddressOf()))) {
        return;
    }
    m_module.SetDebugOutputSink(
        [](const char* line, size_t length, void*) { std::fwrite(line, 1, length, stderr); },
        nullptr);
    BStr folder = settings.folder ? BStr(*settings.folder) : BStr();
    BStr prefix("nqpm");
    BStr extension(".log");
    diagnostics->InitializeLogging(folder.Get(), prefix.Get(), extension.Get(),
                                   settings.level.value_or(2), VARIANT_TRUE);
}

}  // namespace nqpm
