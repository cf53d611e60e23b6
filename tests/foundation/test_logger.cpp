#include <gtest/gtest.h>

#include <cctype>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <string>
#include <vector>

#include "foundation/Logger.h"
#include "platform/fs.h"
#include "platform/kernel.h"

namespace {

namespace fs = std::filesystem;
using foundation::Logger;

// Captures the debugger output and restores a silent, disabled logger afterwards.
class LoggerTest : public ::testing::Test {
  protected:
    void SetUp() override {
        platform::SetDebugOutputSink([this](std::string_view line) {
            std::lock_guard<std::mutex> lock(mutex_);
            lines_.emplace_back(line);
        });
        dir_ = fs::temp_directory_path() /
               ("nqpm-logger-" + std::to_string(platform::GetCurrentThreadId()));
        fs::remove_all(dir_);
        fs::create_directories(dir_);
    }
    void TearDown() override {
        Logger().Close();
        Logger().Initialize(std::nullopt, std::nullopt, std::nullopt, 0, false);
        platform::SetDebugOutputSink(nullptr);
        fs::remove_all(dir_);
    }
    std::vector<std::string> Lines() {
        std::lock_guard<std::mutex> lock(mutex_);
        return lines_;
    }
    void ClearLines() {
        std::lock_guard<std::mutex> lock(mutex_);
        lines_.clear();
    }
    static std::string Read(const fs::path& p) {
        std::ifstream in(p);
        std::stringstream s;
        s << in.rdbuf();
        return s.str();
    }
    std::string DatedName(const std::string& folder, const char* prefix, const char* ext) {
        const auto t = platform::GetLocalTime();
        char date[32];
        std::snprintf(date, sizeof date, "-%04d-%02d-%02d", t.year, t.month, t.day);
        return folder + platform::kPathSeparator + prefix + date + ext;
    }

    fs::path dir_;
    std::mutex mutex_;
    std::vector<std::string> lines_;
};

TEST_F(LoggerTest, DefaultsWriteNothingAnywhere) {
    Logger().Log("Fn", foundation::kLogError, "%s", "hidden");
    EXPECT_TRUE(Lines().empty());
    EXPECT_TRUE(fs::is_empty(dir_));
}

TEST_F(LoggerTest, LineHasTheFixedFormat) {
    Logger().Initialize(std::nullopt, std::nullopt, std::nullopt, 4, true);
    ClearLines();
    NQ_TRACE_ENTERED("CAdvancedPortManager::InitializeEx2");
    const auto lines = Lines();
    ASSERT_EQ(lines.size(), 1u);
    // "hh:mm:ss.mmm, tttttt, NqPrtMan, TRACE, function message\n", digits where the shape says 9.
    std::string shape = lines[0];
    for (char& c : shape) {
        c = std::isdigit(static_cast<unsigned char>(c)) ? '9' : c;
    }
    const std::string tail = ", NqPrtMan, TRACE, CAdvancedPortManager::InitializeEx2 Entered...\n";
    ASSERT_GE(shape.size(), tail.size());
    EXPECT_EQ(shape.substr(0, 14), "99:99:99.999, ") << lines[0];
    const std::string id = shape.substr(14, shape.size() - tail.size() - 14);
    EXPECT_GE(id.size(), 6u) << lines[0];
    EXPECT_EQ(id.find_first_not_of('9'), std::string::npos) << lines[0];
    EXPECT_EQ(lines[0].substr(lines[0].size() - tail.size()), tail);
    EXPECT_NE(lines[0].find(std::to_string(platform::GetCurrentThreadId())), std::string::npos);
}

TEST_F(LoggerTest, LevelsAboveTheConfiguredOneAreFilteredAndUnknownLevelsSayUnkn) {
    Logger().Initialize(std::nullopt, std::nullopt, std::nullopt, 2, true);
    ClearLines();
    for (int level = 0; level <= 6; ++level) {
        Logger().Log("F", level, "level %d", level);
    }
    auto lines = Lines();
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_NE(lines[0].find(", ERROR, F level 0"), std::string::npos);
    EXPECT_NE(lines[1].find(", WARN , F level 1"), std::string::npos);
    EXPECT_NE(lines[2].find(", INFO , F level 2"), std::string::npos);

    // A level stored unclamped lets every level through, with "UNKN " past TRACE.
    Logger().SetLevel(7);
    ClearLines();
    for (int level = 3; level <= 6; ++level) {
        Logger().Log("F", level, "x");
    }
    lines = Lines();
    ASSERT_EQ(lines.size(), 4u);
    EXPECT_NE(lines[0].find(", DEBUG, "), std::string::npos);
    EXPECT_NE(lines[1].find(", TRACE, "), std::string::npos);
    EXPECT_NE(lines[2].find(", UNKN , "), std::string::npos);
    EXPECT_NE(lines[3].find(", UNKN , "), std::string::npos);
}

TEST_F(LoggerTest, DisabledLoggerWritesNothingWhateverTheLevel) {
    Logger().Initialize(std::nullopt, std::nullopt, std::nullopt, 4, true);
    Logger().SetEnabled(false);
    ClearLines();
    Logger().Log("F", 0, "x");
    EXPECT_TRUE(Lines().empty());
}

TEST_F(LoggerTest, EmptyMessageGivesNoLine) {
    Logger().Initialize(std::nullopt, std::nullopt, std::nullopt, 4, true);
    ClearLines();
    Logger().Log("F", 0, "%s", "");
    EXPECT_TRUE(Lines().empty());
}

TEST_F(LoggerTest, LongMessageIsCutAt4096Characters) {
    Logger().Initialize(std::nullopt, std::nullopt, std::nullopt, 4, true);
    ClearLines();
    const std::string longText(5000, 'x');
    Logger().Log("F", 0, "%s", longText.c_str());
    const auto lines = Lines();
    ASSERT_EQ(lines.size(), 1u);
    const auto start = lines[0].find("F x") + 2;
    EXPECT_EQ(lines[0].substr(start), std::string(4096, 'x') + "\n");
}

TEST_F(LoggerTest, FileIsDatedAndOpenedLazily) {
    const std::string folder = dir_.string();
    Logger().Initialize(folder, std::string("pm"), std::string(".log"), 4, true);
    const std::string expected = DatedName(folder, "pm", ".log");
    EXPECT_EQ(Logger().CurrentFileName(), expected);
    Logger().Log("F", 0, "first");
    Logger().Log("F", 0, "second");
    const std::string content = Read(expected);
    EXPECT_NE(content.find("LogMsg::Initialize Completed\n"), std::string::npos);
    EXPECT_NE(content.find("F first\n"), std::string::npos);
    EXPECT_NE(content.find("F second\n"), std::string::npos);
}

TEST_F(LoggerTest, NewFolderTakesEffectOnlyAfterClose) {
    const fs::path a = dir_ / "a";
    const fs::path b = dir_ / "b";
    fs::create_directories(a);
    fs::create_directories(b);
    Logger().Initialize(a.string(), std::string("p"), std::string(".txt"), 4, true);
    Logger().Log("F", 0, "one");
    Logger().Initialize(b.string(), std::string("p"), std::string(".txt"), 4, true);
    Logger().Log("F", 0, "two");
    EXPECT_NE(Read(DatedName(a.string(), "p", ".txt")).find("F two"), std::string::npos);
    EXPECT_TRUE(fs::is_empty(b));

    Logger().Close();
    Logger().Log("F", 0, "three");
    EXPECT_NE(Read(DatedName(b.string(), "p", ".txt")).find("F three"), std::string::npos);
    EXPECT_EQ(Read(DatedName(a.string(), "p", ".txt")).find("F three"), std::string::npos);
}

TEST_F(LoggerTest, NoFolderMeansNoFileButTheDebuggerOutputStillGetsEachLine) {
    Logger().Initialize(std::nullopt, std::string("p"), std::string(".log"), 4, true);
    ClearLines();
    Logger().Log("F", 0, "line");
    EXPECT_EQ(Lines().size(), 1u);
    EXPECT_EQ(Logger().CurrentFileName(), "");
}

TEST_F(LoggerTest, UnwritableFolderIsRetriedOnTheNextLine) {
    const fs::path later = dir_ / "later";
    Logger().Initialize(later.string(), std::string("p"), std::string(".log"), 4, true);
    Logger().Log("F", 0, "lost");
    fs::create_directories(later);
    Logger().Log("F", 0, "kept");
    const std::string content = Read(DatedName(later.string(), "p", ".log"));
    EXPECT_EQ(content.find("lost"), std::string::npos);
    EXPECT_NE(content.find("F kept"), std::string::npos);
}

}  // namespace
