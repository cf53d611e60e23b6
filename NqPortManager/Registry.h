// A hierarchical registry standing in for HKEY_CLASSES_ROOT, kept in a file. Key and value names
// compare without regard to ASCII case and keep the spelling first written; the value named ""
// is the key's default value.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace registry {

struct RegistryValue {
    enum class Type { kString, kDword, kBinary };
    Type type = Type::kString;
    std::string text;            // kString, UTF-8
    uint32_t dword = 0;          // kDword
    std::vector<uint8_t> bytes;  // kBinary

    bool operator==(const RegistryValue&) const = default;
};

struct CaseInsensitiveLess {
    using is_transparent = void;
    bool operator()(std::string_view a, std::string_view b) const;
};

// Paths deeper than this are refused when read, so that no walk of a tree runs deep.
inline constexpr size_t kMaxKeyDepth = 64;

class RegistryKey {
  public:
    RegistryKey* Find(std::string_view name);
    const RegistryKey* Find(std::string_view name) const;
    // The subkey, made when missing.
    RegistryKey& Open(std::string_view name);
    // Removes the subkey with everything below it; false when there was none.
    bool Remove(std::string_view name);
    // Names separated by backslashes; null when any is missing.
    const RegistryKey* FindPath(std::string_view path) const;

    std::map<std::string, RegistryValue, CaseInsensitiveLess> values;
    std::map<std::string, RegistryKey, CaseInsensitiveLess> subkeys;

    bool operator==(const RegistryKey&) const = default;
};

// Binary values as text: two lower-case hex digits a byte; ParseHex takes either case and
// refuses an odd length or anything but hex digits.
std::string HexText(const std::vector<uint8_t>& bytes);
bool ParseHex(std::string_view text, std::vector<uint8_t>& bytes);

// The file's text: JSON with one entry per key and its full path, so that reading it back needs
// no recursion. False with the reason when a name cannot be written (not UTF-8).
bool SerializeRegistry(const RegistryKey& root, std::string& text, std::string& error);
// False with the reason, root untouched, for anything but a well-formed registry file.
bool ParseRegistry(const std::string& text, RegistryKey& root, std::string& error);

// $NQPM_REGISTRY, else nqportmanager/registry.json in the user's data folder.
std::string DefaultRegistryPath();
// A missing file reads as an empty registry.
bool ReadRegistryFile(const std::string& path, RegistryKey& root, std::string& error);
// Under the file's lock: reads it, lets edit change the tree and writes it back atomically. A
// file that cannot be parsed, or an edit that returns false, leaves the file as it was.
bool EditRegistryFile(const std::string& path,
                      const std::function<bool(RegistryKey& root, std::string& error)>& edit,
                      std::string& error);

}  // namespace registry
