// A registrar script, with the names the module fills in, parsed and run both ways.
#include <map>

#include "NqPortManager/Registrar.h"
#include "NqPortManager/Registry.h"
#include "fuzz/FuzzSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static const std::map<std::string, std::string> kReplacements = {
        {"APPID", "{8E6F1A52-3C4B-4D8E-9F10-2A3B4C5D6E7F}"},
        {"CLASS", "AdvancedPortManager"},
        {"CLSID", "{1B2C3D4E-5F60-4718-829A-ABCDEF012345}"},
        {"LIBID", "{0F1E2D3C-4B5A-4968-8776-655443322110}"},
        {"MODULE", "/usr/lib/libNqPortManager.so"},
        {"MODULEDIR", "/usr/lib"}};
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    registry::Script script;
    std::string error;
    if (!registry::ParseScript(text, kReplacements, script, error)) {
        FUZZ_CHECK(error.rfind("line ", 0) == 0);
        return 0;
    }

    registry::RegistryKey root;
    registry::RunScript(script, root, true);
    // What registration wrote survives the file.
    std::string file;
    if (registry::SerializeRegistry(root, file, error)) {
        registry::RegistryKey read;
        FUZZ_CHECK(registry::ParseRegistry(file, read, error));
        FUZZ_CHECK(read == root);
    }

    // Unregistering leaves at the top only keys the script marks NoRemove.
    registry::RunScript(script, root, false);
    for (const auto& [name, key] : root.subkeys) {
        bool kept = false;
        for (const registry::ScriptKey& k : script.keys) {
            kept = kept || (k.flag == registry::ScriptKey::Flag::kNoRemove &&
                            !registry::CaseInsensitiveLess()(k.name, name) &&
                            !registry::CaseInsensitiveLess()(name, k.name));
        }
        FUZZ_CHECK(kept);
    }
    return 0;
}
