// nqpm register / unregister / registry: the module's registration in the file-backed registry.
#include <cstdio>
#include <string>
#include <utility>

#include <nqportmanager/client.h>

#include "NqPortManager/Registry.h"
#include "platform/fs.h"
#include "platform/module.h"
#include "tools/nqpm/Cli.h"
#include "tools/nqpm/Commands.h"
#include "tools/nqpm/ModuleClient.h"

namespace nqpm {

namespace {

const char* const kRegisterUsage =
    "usage: nqpm register|unregister [--module PATH] [--registry FILE]\n"
    "Runs the module's DllRegisterServer (or DllUnregisterServer) against the registry file.\n"
    "The module defaults to the one installed beside nqpm (../lib/libNqPortManager.so), the\n"
    "registry to $NQPM_REGISTRY, else $XDG_DATA_HOME/nqportmanager/registry.json.\n";

const char* const kRegistryUsage =
    "usage: nqpm registry [--registry FILE] [--json]\n"
    "Prints every key of the registry file with its values, as registration wrote them.\n";

std::string ValueText(const registry::RegistryValue& v) {
    switch (v.type) {
        case registry::RegistryValue::Type::kDword:
            return "d '" + std::to_string(v.dword) + "'";
        case registry::RegistryValue::Type::kBinary:
            return "b '" + registry::HexText(v.bytes) + "'";
        case registry::RegistryValue::Type::kString:
            break;
    }
    return "s '" + v.text + "'";
}

void PrintKeys(const registry::RegistryKey& key, const std::string& path, Json* json) {
    for (const auto& [name, sub] : key.subkeys) {
        const std::string subPath = path.empty() ? name : path + "\\" + name;
        Json values = Json::object();
        std::string line = subPath;
        for (const auto& [valueName, value] : sub.values) {
            const std::string text = ValueText(value);
            values[valueName.empty() ? "@" : valueName] = text;
            line += "\n    " + (valueName.empty() ? std::string("@") : valueName) + " = " + text;
        }
        if (json != nullptr) {
            json->push_back({{"key", subPath}, {"values", values}});
        } else {
            std::printf("%s\n", line.c_str());
        }
        PrintKeys(sub, subPath, json);
    }
}

int RunRegistration(int argc, char** argv, bool registering) {
    const char* name = registering ? "register" : "unregister";
    Options options(name, {{"module", true}, {"registry", true}}, kRegisterUsage);
    options.Parse(argc, argv);
    if (options.WantsHelp()) {
        std::fputs(kRegisterUsage, stdout);
        return kExitOk;
    }
    if (options.Has("registry")) {
        platform::SetEnvironmentValue("NQPM_REGISTRY", options.Value("registry"));
    }
    const std::string path = options.Has("module") ? options.Value("module") : ModuleBesideNqpm();
    std::string error;
    void* module = platform::LoadModule(path, error);
    const auto entry = reinterpret_cast<HRESULT (*)()>(
        platform::ModuleSymbol(module, registering ? "DllRegisterServer" : "DllUnregisterServer"));
    if (entry == nullptr) {
        std::fprintf(stderr, "nqpm %s: %s\n", name,
                     module == nullptr ? error.c_str() : "not an NqPortManager module");
        return kExitFailed;
    }
    const HRESULT hr = entry();
    if (FAILED(hr)) {
        std::fprintf(stderr, "nqpm %s: failed (0x%08X), see the module's log\n", name,
                     static_cast<unsigned>(hr));
        return kExitFailed;
    }
    return kExitOk;
}

}  // namespace

int RunRegister(int argc, char** argv) {
    return RunRegistration(argc, argv, true);
}

int RunUnregister(int argc, char** argv) {
    return RunRegistration(argc, argv, false);
}

int RunRegistry(int argc, char** argv) {
    Options options("registry", {{"registry", true}}, kRegistryUsage);
    options.Parse(argc, argv);
    if (options.WantsHelp()) {
        std::fputs(kRegistryUsage, stdout);
        return kExitOk;
    }
    const std::string path =
        options.Has("registry") ? options.Value("registry") : registry::DefaultRegistryPath();
    registry::RegistryKey root;
    std::string error;
    if (path.empty() || !registry::ReadRegistryFile(path, root, error)) {
        std::fprintf(stderr, "nqpm registry: %s\n",
                     path.empty() ? "no registry file (set NQPM_REGISTRY)" : error.c_str());
        return kExitFailed;
    }
    if (options.Json()) {
        Json keys = Json::array();
        PrintKeys(root, "", &keys);
        PrintJson({{"registry", path}, {"keys", keys}});
    } else {
        PrintKeys(root, "", nullptr);
    }
    return kExitOk;
}

}  // namespace nqpm
