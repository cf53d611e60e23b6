#include "NqPortManager/Registrar.h"

#include <cctype>
#include <charconv>

namespace registry {

namespace {

struct Token {
    enum class Kind { kName, kEquals, kOpen, kClose, kEnd };
    Kind kind = Kind::kEnd;
    std::string text;
    bool quoted = false;
    int line = 1;
};

bool IsSpace(char c) {
    return c == ' ' || c == '\t' || c == '\r' || c == '\n' || c == '\f' || c == '\v';
}

bool SameWord(std::string_view a, std::string_view b) {
    return !CaseInsensitiveLess()(a, b) && !CaseInsensitiveLess()(b, a);
}

class Parser {
  public:
    Parser(std::string_view text, const std::map<std::string, std::string>& replacements)
        : text_(text), replacements_(replacements) {}

    bool Parse(Script& script) {
        Next();
        while (token_.kind != Token::Kind::kEnd) {
            if (!IsBare("HKCR") && !IsBare("HKEY_CLASSES_ROOT")) {
                return Fail(token_.kind == Token::Kind::kName
                                ? "only HKCR is served, not '" + token_.text + "'"
                                : "a root key (HKCR) expected");
            }
            Next();
            if (!Expect(Token::Kind::kOpen, "'{' after the root key") ||
                !ParseBody(script.keys, 1)) {
                return false;
            }
        }
        return error_.empty();
    }

    const std::string& Error() const { return error_; }

  private:
    bool IsBare(std::string_view word) const {
        return token_.kind == Token::Kind::kName && !token_.quoted && SameWord(token_.text, word);
    }

    bool Fail(const std::string& reason) {
        if (error_.empty()) {
            error_ = "line " + std::to_string(token_.line) + ": " + reason;
        }
        token_.kind = Token::Kind::kEnd;
        return false;
    }

    bool Expect(Token::Kind kind, const char* what) {
        if (token_.kind != kind) {
            return Fail(std::string(what) + " expected");
        }
        Next();
        return true;
    }

    // Keys and val entries up to the closing brace, which it consumes.
    bool ParseBody(std::vector<ScriptKey>& keys, int depth) {
        if (depth > kMaxScriptDepth) {
            return Fail("blocks nested too deep");
        }
        while (token_.kind != Token::Kind::kClose) {
            if (token_.kind != Token::Kind::kName) {
                return Fail(token_.kind == Token::Kind::kEnd && error_.empty()
                                ? "'}' missing"
                                : "a key name expected");
            }
            if (IsBare("val")) {
                Next();
                std::pair<std::string, RegistryValue> value;
                if (!Name(value.first) ||
                    !Expect(Token::Kind::kEquals, "'=' after the value name") ||
                    !Value(value.second)) {
                    return false;
                }
                if (depth == 1) {
                    return Fail("a named value directly under the root");
                }
                pendingValues_.push_back(std::move(value));
                continue;
            }
            ScriptKey key;
            if (IsBare("NoRemove")) {
                key.flag = ScriptKey::Flag::kNoRemove;
            } else if (IsBare("ForceRemove")) {
                key.flag = ScriptKey::Flag::kForceRemove;
            } else if (IsBare("Delete")) {
                key.flag = ScriptKey::Flag::kDelete;
            }
            if (key.flag != ScriptKey::Flag::kNone) {
                Next();
            }
            if (!Name(key.name)) {
                return false;
            }
            // The file keeps keys by their backslash-separated path.
            if (key.name.find('\\') != std::string::npos) {
                return Fail("a backslash in the key name '" + key.name + "'");
            }
            if (token_.kind == Token::Kind::kEquals) {
                Next();
                if (!Value(key.defaultValue.emplace())) {
                    return false;
                }
            }
            if (token_.kind == Token::Kind::kOpen) {
                Next();
                std::vector<std::pair<std::string, RegistryValue>> outer;
                outer.swap(pendingValues_);
                if (!ParseBody(key.subkeys, depth + 1)) {
                    return false;
                }
                key.values.swap(pendingValues_);
                pendingValues_.swap(outer);
            }
            keys.push_back(std::move(key));
        }
        Next();
        return true;
    }

    bool Name(std::string& name) {
        if (token_.kind != Token::Kind::kName) {
            return Fail("a name expected");
        }
        name = std::move(token_.text);
        if (name.empty()) {
            return Fail("an empty name");
        }
        Next();
        return true;
    }

    bool Value(RegistryValue& value) {
        if (token_.kind != Token::Kind::kName || token_.quoted) {
            return Fail("a value type (s, d or b) expected");
        }
        const std::string type = token_.text;
        Next();
        if (token_.kind != Token::Kind::kName) {
            return Fail("a value expected after the type");
        }
        std::string text = std::move(token_.text);
        Next();
        if (SameWord(type, "s")) {
            value = {RegistryValue::Type::kString, std::move(text), 0, {}};
            return true;
        }
        if (SameWord(type, "d")) {
            value = {RegistryValue::Type::kDword, "", 0, {}};
            const bool hex =
                text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X');
            const char* first = text.data() + (hex ? 2 : 0);
            const char* last = text.data() + text.size();
            const auto [end, ec] = std::from_chars(first, last, value.dword, hex ? 16 : 10);
            return (ec == std::errc() && end == last && first != last) ||
                   Fail("'" + text + "' is not a DWORD");
        }
        if (SameWord(type, "b")) {
            value = {RegistryValue::Type::kBinary, "", 0, {}};
            if (text.size() % 2 != 0) {
                return Fail("binary value of odd length");
            }
            return ParseHex(text, value.bytes) || Fail("'" + text + "' is not hex");
        }
        return Fail("unknown value type '" + type + "'");
    }

    // Replaces %NAME% in a name or value.
    bool Substitute(std::string& text) {
        std::string out;
        for (size_t i = 0; i < text.size(); ++i) {
            if (text[i] != '%') {
                out += text[i];
                continue;
            }
            const size_t close = text.find('%', i + 1);
            if (close == std::string::npos) {
                return Fail("'%' without its closing '%'");
            }
            const std::string name = text.substr(i + 1, close - i - 1);
            if (name.empty()) {
                out += '%';
            } else if (const auto it = replacements_.find(name); it != replacements_.end()) {
                out += it->second;
            } else {
                return Fail("unknown replacement %" + name + "%");
            }
            i = close;
        }
        text = std::move(out);
        return true;
    }

    void Next() {
        if (!error_.empty()) {
            token_.kind = Token::Kind::kEnd;
            return;
        }
        while (at_ < text_.size() && IsSpace(text_[at_])) {
            line_ += text_[at_++] == '\n' ? 1 : 0;
        }
        token_ = Token{};
        token_.line = line_;
        if (at_ >= text_.size()) {
            return;
        }
        const char c = text_[at_];
        // A brace followed by anything but space or a brace starts a bare name ({GUID}).
        const char after = at_ + 1 < text_.size() ? text_[at_ + 1] : ' ';
        const bool alone = IsSpace(after) || after == '{' || after == '}';
        if (c == '=' || ((c == '{' || c == '}') && alone)) {
            token_.kind = c == '=' ? Token::Kind::kEquals
                                   : (c == '{' ? Token::Kind::kOpen : Token::Kind::kClose);
            ++at_;
            return;
        }
        token_.kind = Token::Kind::kName;
        if (c == '\'') {
            token_.quoted = true;
            for (++at_;; ++at_) {
                if (at_ >= text_.size()) {
                    Fail("unterminated quote");
                    return;
                }
                if (text_[at_] == '\'') {
                    if (at_ + 1 < text_.size() && text_[at_ + 1] == '\'') {
                        ++at_;
                    } else {
                        ++at_;
                        break;
                    }
                }
                line_ += text_[at_] == '\n' ? 1 : 0;
                token_.text += text_[at_];
            }
        } else {
            while (at_ < text_.size() && !IsSpace(text_[at_]) && text_[at_] != '=' &&
                   text_[at_] != '\'') {
                token_.text += text_[at_++];
            }
        }
        Substitute(token_.text);
    }

    std::string_view text_;
    const std::map<std::string, std::string>& replacements_;
    size_t at_ = 0;
    int line_ = 1;
    Token token_;
    std::string error_;
    // The val entries of the block being parsed, handed to its key when the block ends.
    std::vector<std::pair<std::string, RegistryValue>> pendingValues_;
};

void Run(const ScriptKey& k, RegistryKey& parent, bool registering) {
    if (registering) {
        if (k.flag == ScriptKey::Flag::kDelete || k.flag == ScriptKey::Flag::kForceRemove) {
            parent.Remove(k.name);
        }
        if (k.flag == ScriptKey::Flag::kDelete) {
            return;
        }
        RegistryKey& key = parent.Open(k.name);
        if (k.defaultValue) {
            key.values[""] = *k.defaultValue;
        }
        for (const auto& [name, value] : k.values) {
            key.values[name] = value;
        }
        for (const ScriptKey& sub : k.subkeys) {
            Run(sub, key, true);
        }
        return;
    }
    RegistryKey* key = parent.Find(k.name);
    if (key == nullptr || k.flag == ScriptKey::Flag::kDelete) {
        return;
    }
    if (k.flag != ScriptKey::Flag::kNoRemove) {
        parent.Remove(k.name);
        return;
    }
    for (const auto& value : k.values) {
        key->values.erase(value.first);
    }
    for (const ScriptKey& sub : k.subkeys) {
        Run(sub, *key, false);
    }
}

}  // namespace

bool ParseScript(std::string_view text, const std::map<std::string, std::string>& replacements,
                 Script& script, std::string& error) {
    Parser parser(text, replacements);
    Script parsed;
    if (!parser.Parse(parsed)) {
        error = parser.Error();
        return false;
    }
    script = std::move(parsed);
    return true;
}

void RunScript(const Script& script, RegistryKey& root, bool registering) {
    for (const ScriptKey& key : script.keys) {
        Run(key, root, registering);
    }
}

}  // namespace registry
