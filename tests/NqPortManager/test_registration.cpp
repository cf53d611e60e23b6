// The registrar scripts and the file-backed registry they run against.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <thread>
#include <vector>

#include "NqPortManager/Registrar.h"
#include "NqPortManager/Registry.h"

namespace {

using registry::RegistryKey;
using registry::RegistryValue;
using Type = registry::RegistryValue::Type;

// The AppID script and a class script as the module carries them.
const char kScript[] = R"(HKCR
{
    NoRemove AppID
    {
        '%APPID%' = s 'NqPortManager'
        'NqPortManager.DLL'
        {
            val AppID = s '%APPID%'
        }
    }
    NqPortManager.AdvancedPortManager.1 = s 'AdvancedPortManager Class'
    {
        CLSID = s '{C1A55000-0000-4000-8000-000000000001}'
    }
    NoRemove CLSID
    {
        ForceRemove {C1A55000-0000-4000-8000-000000000001} = s 'AdvancedPortManager Class'
        {
            ProgID = s 'NqPortManager.AdvancedPortManager.1'
            'Programmable'
            InprocServer32 = s '%MODULE%'
            {
                val ThreadingModel = s 'Apartment'
            }
            val AppID = s '%APPID%'
            Flags = d '0x1F'
            Blob = b '00ff10'
        }
    }
    Delete Obsolete
}
)";
const std::map<std::string, std::string> kReplacements = {
    {"MODULE", "/opt/it's here/libNqPortManager.so"},
    {"APPID", "{A9910000-0000-4000-8000-00000000000A}"}};

registry::Script Parsed(const std::string& text) {
    registry::Script script;
    std::string error;
    EXPECT_TRUE(registry::ParseScript(text, kReplacements, script, error)) << error;
    return script;
}

std::string Text(const RegistryKey& root, const std::string& path, const std::string& value = "") {
    const RegistryKey* key = root.FindPath(path);
    if (key == nullptr) {
        return "<no key>";
    }
    const auto it = key->values.find(value);
    return it == key->values.end() ? "<no value>" : it->second.text;
}

TEST(RegistrarScript, RegisterWritesEveryEntryAndUnregisterLeavesOnlyWhatIsShared) {
    RegistryKey root;
    root.Open("CLSID").Open("{C1A55000-0000-4000-8000-000000000001}").Open("Stale");
    root.Open("clsid").Open("{0THER}");  // another component's class, under the same key
    root.Open("Obsolete").Open("Child");
    const registry::Script script = Parsed(kScript);
    registry::RunScript(script, root, true);

    const std::string clsid = "CLSID\\{c1a55000-0000-4000-8000-000000000001}";  // any case
    EXPECT_EQ(Text(root, "AppID\\{A9910000-0000-4000-8000-00000000000A}"), "NqPortManager");
    EXPECT_EQ(Text(root, "AppID\\NqPortManager.DLL", "appid"), kReplacements.at("APPID"));
    EXPECT_EQ(Text(root, "NqPortManager.AdvancedPortManager.1\\CLSID"),
              "{C1A55000-0000-4000-8000-000000000001}");
    EXPECT_EQ(Text(root, clsid), "AdvancedPortManager Class");
    EXPECT_EQ(Text(root, clsid + "\\InprocServer32"), kReplacements.at("MODULE"));
    EXPECT_EQ(Text(root, clsid + "\\InprocServer32", "ThreadingModel"), "Apartment");
    EXPECT_EQ(Text(root, clsid + "\\Programmable"), "<no value>");
    EXPECT_EQ(Text(root, clsid + "\\Stale"), "<no key>") << "ForceRemove keeps no old subkey";
    const RegistryKey& cls = *root.FindPath(clsid);
    EXPECT_EQ(cls.subkeys.at("Flags").values.at(""), (RegistryValue{Type::kDword, "", 0x1F, {}}));
    EXPECT_EQ(cls.subkeys.at("Blob").values.at("").bytes, (std::vector<uint8_t>{0, 0xFF, 0x10}));
    EXPECT_EQ(root.Find("Obsolete"), nullptr);
    EXPECT_EQ(root.subkeys.find("clsid")->first, "CLSID") << "the first spelling stays";

    registry::RunScript(script, root, false);
    ASSERT_EQ(root.subkeys.size(), 2u);
    EXPECT_TRUE(root.FindPath("AppID")->subkeys.empty());
    EXPECT_EQ(root.FindPath("CLSID")->subkeys.size(), 1u);
    EXPECT_NE(root.FindPath("CLSID\\{0THER}"), nullptr);
}

TEST(RegistrarScript, MalformedScriptsAreRefusedWithTheirLine) {
    std::string nested = "HKCR {";
    for (int i = 0; i <= registry::kMaxScriptDepth; ++i) {
        nested += " A {";
    }
    const std::pair<std::string, std::string> kBad[] = {
        {"HKCR\n{\n  A\n  {\n", "line 5: '}' missing"},
        {"HKCR\n{\n}\n}", "line 4: a root key (HKCR) expected"},
        {"HKLM\n{\n}", "line 1: only HKCR is served, not 'HKLM'"},
        {"HKCR { 'A = s 'x' }", "unterminated quote"},
        {"HKCR { A = q 'x' }", "line 1: unknown value type 'q'"},
        {"HKCR { A = s }", "a value expected after the type"},
        {"HKCR { A = d '12x' }", "'12x' is not a DWORD"},
        {"HKCR { A = d '4294967296' }", "is not a DWORD"},
        {"HKCR { A = b 'abc' }", "binary value of odd length"},
        {"HKCR { A = b 'zz' }", "'zz' is not hex"},
        {"HKCR { val A = s 'x' }", "a named value directly under the root"},
        {"HKCR { A { val = s 'x' } }", "a name expected"},
        {"HKCR { A = s '%NOPE%' }", "unknown replacement %NOPE%"},
        {"HKCR { A = s '50%' }", "'%' without its closing '%'"},
        {"HKCR { '' }", "an empty name"},
        {"HKCR { A\\B }", "line 1: a backslash in the key name 'A\\B'"},
        {std::string("HKCR { \x01\xff", 9) + std::string(1, '\0') + " = s '\n",
         "line 1: unterminated quote"},
        {nested, "blocks nested too deep"},
    };
    for (const auto& [text, expected] : kBad) {
        SCOPED_TRACE(text.substr(0, 40));
        registry::Script script;
        script.keys.emplace_back();
        std::string error;
        EXPECT_FALSE(registry::ParseScript(text, kReplacements, script, error));
        EXPECT_NE(error.find(expected), std::string::npos) << error;
        EXPECT_EQ(script.keys.size(), 1u) << "a refused script changes nothing";
    }
    // Quotes, case-insensitive keywords, %% and braces without spaces.
    const registry::Script ok = Parsed("hkcr { noremove 'it''s' { VAL v=s '100%%' }}");
    ASSERT_EQ(ok.keys.size(), 1u);
    EXPECT_EQ(ok.keys[0].flag, registry::ScriptKey::Flag::kNoRemove);
    EXPECT_EQ(ok.keys[0].name, "it's");
    EXPECT_EQ(ok.keys[0].values.at(0).second.text, "100%");
}

class RegistryFile : public ::testing::Test {
  protected:
    void SetUp() override {
        dir_ = std::filesystem::path(::testing::TempDir()) /
               ("nqpm-registry-" + std::to_string(::getpid()) + "-" +
                ::testing::UnitTest::GetInstance()->current_test_info()->name());
        std::filesystem::remove_all(dir_);
        path_ = (dir_ / "sub" / "registry.json").string();
    }
    void TearDown() override { std::filesystem::remove_all(dir_); }

    std::string FileText() const {
        std::ifstream in(path_, std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(in), {});
    }

    std::filesystem::path dir_;
    std::string path_;
};

TEST_F(RegistryFile, RoundTripsEveryValueTypeAndRefusesWhatItCannotRead) {
    RegistryKey root;
    registry::RunScript(Parsed(kScript), root, true);
    root.Open("Ünïcode").values["\x01 name"] = {Type::kString, std::string("a\0b", 3), 0, {}};
    std::string error;
    ASSERT_TRUE(registry::EditRegistryFile(
        path_, [&](RegistryKey& r, std::string&) { return r = root, true; }, error))
        << error;
    RegistryKey back;
    ASSERT_TRUE(registry::ReadRegistryFile(path_, back, error)) << error;
    EXPECT_EQ(back, root);

    const std::string before = FileText();
    const char* kBadFiles[] = {
        "not json",
        R"({"format":"other","version":1,"keys":[]})",
        R"({"format":"nqportmanager-registry","version":2,"keys":[]})",
        R"({"format":7,"version":1,"keys":[]})",
        R"({"format":"nqportmanager-registry","version":1,"keys":[{"path":"A\\\\B","values":{}}]})",
        R"({"format":"nqportmanager-registry","version":1,"keys":[{"path":"A","values":{"v":{"d":-1}}}]})",
        R"({"format":"nqportmanager-registry","version":1,"keys":[{"path":"A","values":{"v":{"b":"0g"}}}]})",
        R"({"format":"nqportmanager-registry","version":1,"keys":[{"path":"A","values":{"v":{"x":"1"}}}]})",
    };
    for (const char* bad : kBadFiles) {
        SCOPED_TRACE(bad);
        RegistryKey untouched = root;
        EXPECT_FALSE(registry::ParseRegistry(bad, untouched, error));
        EXPECT_EQ(untouched, root);
    }
    std::string deep = "A";
    for (size_t i = 0; i < registry::kMaxKeyDepth; ++i) {
        deep += "\\\\A";
    }
    EXPECT_FALSE(registry::ParseRegistry(
        R"({"format":"nqportmanager-registry","version":1,"keys":[{"path":")" + deep +
            R"(","values":{}}]})",
        back, error));

    // A file it cannot parse is neither used nor overwritten.
    { std::ofstream(path_, std::ios::binary) << "{ broken"; }
    bool edited = false;
    EXPECT_FALSE(registry::EditRegistryFile(
        path_, [&](RegistryKey&, std::string&) { return edited = true; }, error));
    EXPECT_FALSE(edited);
    EXPECT_EQ(FileText(), "{ broken");
    EXPECT_NE(error.find(path_), std::string::npos) << error;
    EXPECT_NE(before, "");
}

TEST_F(RegistryFile, ConcurrentEditsAreAllKept) {
    constexpr int kEach = 25;
    std::vector<std::thread> writers;
    for (int w = 0; w < 2; ++w) {
        writers.emplace_back([&, w] {
            for (int i = 0; i < kEach; ++i) {
                std::string error;
                EXPECT_TRUE(registry::EditRegistryFile(
                    path_,
                    [&](RegistryKey& root, std::string&) {
                        root.Open("W" + std::to_string(w) + "-" + std::to_string(i));
                        return true;
                    },
                    error))
                    << error;
            }
        });
    }
    for (auto& t : writers) {
        t.join();
    }
    RegistryKey root;
    std::string error;
    ASSERT_TRUE(registry::ReadRegistryFile(path_, root, error)) << error;
    EXPECT_EQ(root.subkeys.size(), 2u * kEach);
}

}  // namespace
