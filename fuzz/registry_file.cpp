// The registry file as read from disk.
#include "NqPortManager/Registry.h"
#include "fuzz/FuzzSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string text(reinterpret_cast<const char*>(data), size);
    registry::RegistryKey root;
    root.Open("Before").values[""] = {registry::RegistryValue::Type::kDword, "", 7, {}};
    const registry::RegistryKey before = root;
    std::string error;
    if (!registry::ParseRegistry(text, root, error)) {
        FUZZ_CHECK(root == before && !error.empty());
        return 0;
    }
    // Written and read back, the tree is the same, and so is the text written from it.
    std::string written;
    FUZZ_CHECK(registry::SerializeRegistry(root, written, error));
    registry::RegistryKey again;
    FUZZ_CHECK(registry::ParseRegistry(written, again, error));
    FUZZ_CHECK(again == root);
    std::string rewritten;
    FUZZ_CHECK(registry::SerializeRegistry(again, rewritten, error) && rewritten == written);
    return 0;
}
