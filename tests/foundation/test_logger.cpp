#include <gtest/gtest.h>

#include <cctype>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "foundation/Logger.h"
#include "platform/fs.h"
#include "platform/kernel.h"
#include "tests/support/LogCapture.h"

namespace {

namespace fs = std::filesystem;
using foundation::Logger;

// A capture of the debugger output, and a folder of the test's own for the log files.
class LoggerTest : public ::testing::Test {
  protected:
    LoggerTest() {
        fs::remove_all(dir_);
        fs::create_directories(dir_);
        Logger().Initialize(std::nullopt, std::nullopt, std::nullopt, 0, false);
    }
    ~LoggerTest() override {
        Logger().Close();
        fs::remove_all(dir_);
    }
    void Init(const fs::path& folder, int level = 4) {
        Logger().Initialize(folder.string(), std::string("p"), std::string(".log"), level, true);
        log_.Clear();
    }
    static std::string Read(const fs::path& folder) {
        const auto t = platform::GetLocalTime();
        char date[32];
        std::snprintf(date, sizeof date, "-%04d-%02d-%02d", t.year, t.month, t.day);
        std::ifstream in(folder / (std::string("p") + date + ".log"));
        std::stringstream s;
        s << in.rdbuf();
        return s.str();
    }
    std::vector<std::string> Raw() {
        std::vector<std::string> raw;
        for (const auto& l : log_.Lines()) {
            raw.push_back(l.level + " " + l.function + " " + l.message);
        }
        return raw;
    }

    testsupport::LogCapture log_;
    const fs::path dir_ = fs::temp_directory_path() /
                          ("nqpm-logger-" + std::to_string(platform::GetCurrentThreadId()));
};

TEST_F(LoggerTest, LineHasTheFixedFormat) {
    std::string line;
    platform::SetDebugOutputSink([&](std::string_view l) { line = l; });
    Logger().Initialize(std::nullopt, std::nullopt, std::nullopt, 4, true);
    NQ_TRACE_ENTERED("CAdvancedPortManager::InitializeEx2");
    platform::SetDebugOutputSink(nullptr);
    // "hh:mm:ss.mmm, tttttt, NqPrtMan, TRACE, function message\n", digits where the shape says 9.
    std::string shape = line;
    for (char& c : shape) {
        c = std::isdigit(static_cast<unsigned char>(c)) ? '9' : c;
    }
    const std::string tail = ", NqPrtMan, TRACE, CAdvancedPortManager::InitializeEx2 Entered...\n";
    ASSERT_GE(shape.size(), tail.size() + 20) << line;
    EXPECT_EQ(shape.substr(0, 14), "99:99:99.999, ") << line;
    const std::string id = shape.substr(14, shape.size() - tail.size() - 14);
    EXPECT_EQ(id.find_first_not_of('9'), std::string::npos) << line;
    EXPECT_EQ(line.substr(line.size() - tail.size()), tail);
    EXPECT_NE(line.find(std::to_string(platform::GetCurrentThreadId())), std::string::npos);
}

TEST_F(LoggerTest, LevelsDisabledEmptyAndLongMessages) {
    Logger().Log("F", 0, "hidden while disabled");
    EXPECT_TRUE(log_.Lines().empty());
    Init({}, 2);
    for (int level = 0; level <= 6; ++level) {
        Logger().Log("F", level, "level %d", level);
    }
    Logger().Log("F", 0, "%s", "");  // no line
    // A level stored unclamped lets every level through, with "UNKN" past TRACE.
    Logger().SetLevel(7);
    for (int level = 3; level <= 5; ++level) {
        Logger().Log("F", level, "x");
    }
    Logger().SetEnabled(false);
    Logger().Log("F", 0, "x");
    EXPECT_EQ(Raw(),
              (std::vector<std::string>{"ERROR F level 0", "WARN F level 1", "INFO F level 2",
                                        "DEBUG F x", "TRACE F x", "UNKN F x"}));
    Init({});
    Logger().Log("F", 0, "%s", std::string(5000, 'x').c_str());
    const auto lines = log_.Lines();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].message, std::string(4096, 'x'));
    EXPECT_EQ(Logger().CurrentFileName(), "") << "no folder, no file";
}

TEST_F(LoggerTest, FileIsDatedOpenedLazilyRetriedAndMovesOnlyAfterClose) {
    const fs::path a = dir_ / "a";
    const fs::path b = dir_ / "b";
    Init(a);
    Logger().Log("F", 0, "lost");  // the folder does not exist yet
    fs::create_directories(a);
    fs::create_directories(b);
    Logger().Log("F", 0, "one");
    EXPECT_NE(Logger().CurrentFileName().find(a.string() + platform::kPathSeparator + "p-"),
              std::string::npos);
    Init(b);
    Logger().Log("F", 0, "two");
    EXPECT_TRUE(fs::is_empty(b));
    Logger().Close();
    Logger().Log("F", 0, "three");
    const std::string first = Read(a);
    EXPECT_EQ(first.find("lost"), std::string::npos);
    EXPECT_NE(first.find("F one\n"), std::string::npos);
    EXPECT_NE(first.find("F two\n"), std::string::npos);
    EXPECT_EQ(first.find("three"), std::string::npos);
    EXPECT_NE(Read(b).find("F three\n"), std::string::npos);
}

}  // namespace
