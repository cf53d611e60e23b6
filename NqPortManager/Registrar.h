// The registrar script grammar of COM servers, parsed and run against a registry:
//
//   HKCR
//   {
//       NoRemove CLSID
//       {
//           ForceRemove {GUID} = s 'Class name'
//           {
//               InprocServer32 = s '%MODULE%'
//               {
//                   val ThreadingModel = s 'Apartment'
//               }
//           }
//       }
//   }
//
// Names are quoted ('it''s' for a quote) or bare; a bare keyword (NoRemove, ForceRemove, Delete,
// val, the types) is matched without regard to case. Types: s (string), d (DWORD, decimal or
// 0x hex), b (binary, hex digits). %NAME% is replaced inside names and values, %% is a percent.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "NqPortManager/Registry.h"

namespace registry {

struct ScriptKey {
    // NoRemove: kept at unregistration; ForceRemove: removed with its subkeys before it is
    // written; Delete: removed at registration, its body ignored.
    enum class Flag { kNone, kNoRemove, kForceRemove, kDelete };
    Flag flag = Flag::kNone;
    std::string name;
    std::optional<RegistryValue> defaultValue;
    std::vector<std::pair<std::string, RegistryValue>> values;  // the val entries
    std::vector<ScriptKey> subkeys;
};

// The keys under HKCR (or HKEY_CLASSES_ROOT), in script order; no other root is served.
struct Script {
    std::vector<ScriptKey> keys;
};

// Blocks nested deeper than this are refused, so that neither the parse nor a run goes deep.
inline constexpr int kMaxScriptDepth = 32;

// False with "line N: reason" for anything outside the grammar or an unknown %NAME%.
bool ParseScript(std::string_view text, const std::map<std::string, std::string>& replacements,
                 Script& script, std::string& error);

// Registering writes the keys and values; unregistering removes every key not marked NoRemove
// with all below it, and the val entries of NoRemove keys.
void RunScript(const Script& script, RegistryKey& root, bool registering);

}  // namespace registry
