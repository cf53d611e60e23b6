#include "NqPortManager/Registry.h"

#include <cctype>
#include <charconv>
#include <nlohmann/json.hpp>

#include "platform/fs.h"

namespace registry {

namespace {

constexpr const char* kFormat = "nqportmanager-registry";
constexpr int kVersion = 1;
constexpr size_t kMaxFileSize = 16u << 20;

char Lower(char c) {
    return static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
}

nlohmann::json ValueToJson(const RegistryValue& v) {
    switch (v.type) {
        case RegistryValue::Type::kDword:
            return {{"d", v.dword}};
        case RegistryValue::Type::kBinary:
            return {{"b", HexText(v.bytes)}};
        case RegistryValue::Type::kString:
            break;
    }
    return {{"s", v.text}};
}

bool ValueFromJson(const nlohmann::json& j, RegistryValue& v) {
    if (!j.is_object() || j.size() != 1) {
        return false;
    }
    const auto only = j.begin();
    const std::string& type = only.key();
    const nlohmann::json& data = only.value();
    if (type == "s" && data.is_string()) {
        v = {RegistryValue::Type::kString, data.get<std::string>(), 0, {}};
        return true;
    }
    if (type == "d" && data.is_number_unsigned() && data.get<uint64_t>() <= UINT32_MAX) {
        v = {RegistryValue::Type::kDword, "", data.get<uint32_t>(), {}};
        return true;
    }
    v = {RegistryValue::Type::kBinary, "", 0, {}};
    return type == "b" && data.is_string() && ParseHex(data.get<std::string>(), v.bytes);
}

void AddKeys(const RegistryKey& key, const std::string& path, nlohmann::json& keys) {
    for (const auto& [name, sub] : key.subkeys) {
        const std::string subPath = path.empty() ? name : path + "\\" + name;
        nlohmann::json values = nlohmann::json::object();
        for (const auto& [valueName, value] : sub.values) {
            values[valueName] = ValueToJson(value);
        }
        keys.push_back({{"path", subPath}, {"values", values}});
        AddKeys(sub, subPath, keys);
    }
}

// The names of a path; false for an empty name or one too many.
bool SplitPath(const std::string& path, std::vector<std::string>& names) {
    names.clear();
    size_t start = 0;
    for (;;) {
        const size_t slash = path.find('\\', start);
        names.push_back(path.substr(start, slash - start));
        if (names.back().empty() || names.size() > kMaxKeyDepth) {
            return false;
        }
        if (slash == std::string::npos) {
            return true;
        }
        start = slash + 1;
    }
}

}  // namespace

std::string HexText(const std::vector<uint8_t>& bytes) {
    static constexpr char kHex[] = "0123456789abcdef";
    std::string text;
    for (uint8_t b : bytes) {
        text += kHex[b >> 4];
        text += kHex[b & 15];
    }
    return text;
}

bool ParseHex(std::string_view text, std::vector<uint8_t>& bytes) {
    if (text.size() % 2 != 0) {
        return false;
    }
    std::vector<uint8_t> parsed;
    for (size_t i = 0; i < text.size(); i += 2) {
        uint8_t byte = 0;
        const auto [end, ec] = std::from_chars(text.data() + i, text.data() + i + 2, byte, 16);
        if (ec != std::errc() || end != text.data() + i + 2) {
            return false;
        }
        parsed.push_back(byte);
    }
    bytes = std::move(parsed);
    return true;
}

bool CaseInsensitiveLess::operator()(std::string_view a, std::string_view b) const {
    const size_t n = std::min(a.size(), b.size());
    for (size_t i = 0; i < n; ++i) {
        const char x = Lower(a[i]);
        const char y = Lower(b[i]);
        if (x != y) {
            return static_cast<unsigned char>(x) < static_cast<unsigned char>(y);
        }
    }
    return a.size() < b.size();
}

RegistryKey* RegistryKey::Find(std::string_view name) {
    const auto it = subkeys.find(name);
    return it == subkeys.end() ? nullptr : &it->second;
}

const RegistryKey* RegistryKey::Find(std::string_view name) const {
    const auto it = subkeys.find(name);
    return it == subkeys.end() ? nullptr : &it->second;
}

RegistryKey& RegistryKey::Open(std::string_view name) {
    const auto it = subkeys.find(name);
    return it != subkeys.end() ? it->second : subkeys[std::string(name)];
}

bool RegistryKey::Remove(std::string_view name) {
    const auto it = subkeys.find(name);
    if (it == subkeys.end()) {
        return false;
    }
    subkeys.erase(it);
    return true;
}

const RegistryKey* RegistryKey::FindPath(std::string_view path) const {
    const RegistryKey* key = this;
    while (key != nullptr && !path.empty()) {
        const size_t slash = path.find('\\');
        key = key->Find(path.substr(0, slash));
        path = slash == std::string_view::npos ? std::string_view() : path.substr(slash + 1);
    }
    return key;
}

bool SerializeRegistry(const RegistryKey& root, std::string& text, std::string& error) {
    nlohmann::json keys = nlohmann::json::array();
    AddKeys(root, "", keys);
    try {
        text = nlohmann::json{{"format", kFormat}, {"version", kVersion}, {"keys", keys}}.dump(1);
        text += '\n';
        return true;
    } catch (const nlohmann::json::exception& e) {
        error = std::string("cannot write the registry: ") + e.what();
        return false;
    }
}

bool ParseRegistry(const std::string& text, RegistryKey& root, std::string& error) {
    const nlohmann::json j = nlohmann::json::parse(text, nullptr, false);
    // Compared, never converted: a field of another type is a bad file, not an exception.
    if (j.is_discarded() || !j.is_object() || !j.contains("format") || j["format"] != kFormat ||
        !j.contains("version") || j["version"] != kVersion || !j.contains("keys") ||
        !j["keys"].is_array()) {
        error = "not a registry file of this version";
        return false;
    }
    RegistryKey parsed;
    std::vector<std::string> names;
    for (const nlohmann::json& entry : j["keys"]) {
        if (!entry.is_object() || !entry.contains("path") || !entry["path"].is_string() ||
            !SplitPath(entry["path"].get<std::string>(), names) || !entry.contains("values") ||
            !entry["values"].is_object()) {
            error =
                "malformed key entry: " +
                entry.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace).substr(0, 200);
            return false;
        }
        RegistryKey* key = &parsed;
        for (const std::string& name : names) {
            key = &key->Open(name);
        }
        for (const auto& [name, value] : entry["values"].items()) {
            if (!ValueFromJson(value, key->values[name])) {
                error = "malformed value " + name + " of " + entry["path"].get<std::string>();
                return false;
            }
        }
    }
    root = std::move(parsed);
    return true;
}

std::string DefaultRegistryPath() {
    const std::string chosen = platform::EnvironmentValue("NQPM_REGISTRY");
    if (!chosen.empty()) {
        return chosen;
    }
    const std::string data = platform::UserDataFolder();
    return data.empty() ? std::string() : data + "/nqportmanager/registry.json";
}

bool ReadRegistryFile(const std::string& path, RegistryKey& root, std::string& error) {
    std::string text;
    bool missing = false;
    if (!platform::ReadWholeFile(path, text, error, missing)) {
        if (missing) {
            root = RegistryKey();
            return true;
        }
        return false;
    }
    if (text.size() > kMaxFileSize) {
        error = path + ": larger than a registry file can be";
        return false;
    }
    if (!ParseRegistry(text, root, error)) {
        error = path + ": " + error;
        return false;
    }
    return true;
}

bool EditRegistryFile(const std::string& path,
                      const std::function<bool(RegistryKey& root, std::string& error)>& edit,
                      std::string& error) {
    if (path.empty()) {
        error = "no registry file: neither NQPM_REGISTRY, XDG_DATA_HOME nor HOME is set";
        return false;
    }
    const platform::FileLock lock(path);
    if (!lock.IsHeld()) {
        error = lock.Error();
        return false;
    }
    RegistryKey root;
    std::string text;
    return ReadRegistryFile(path, root, error) && edit(root, error) &&
           SerializeRegistry(root, text, error) && platform::ReplaceFile(path, text, error);
}

}  // namespace registry
