#include <gtest/gtest.h>

#include <string>

#include "foundation/Logger.h"
#include "foundation/LoggingControl.h"

namespace {

class LoggingControl : public ::testing::Test {
  protected:
    void TearDown() override {
        foundation::Logger().Close();
        foundation::Logger().Initialize(std::nullopt, std::nullopt, std::nullopt, 0, false);
    }
};

TEST_F(LoggingControl, InitializeClampsTheLevelPutStoresItAndEnabledFollowsNonZero) {
    INT level = -1;
    VARIANT_BOOL enabled = 5;
    for (const auto& [put, clamped] : {std::pair{7, 4}, std::pair{-3, 0}, std::pair{2, 2}}) {
        ASSERT_EQ(foundation::InitializeLogging(nullptr, nullptr, nullptr, put, 1), S_OK);
        ASSERT_EQ(foundation::GetLogLevel(&level), S_OK);
        EXPECT_EQ(level, clamped);
        ASSERT_EQ(foundation::GetLoggingEnabled(&enabled), S_OK);
        EXPECT_EQ(enabled, VARIANT_TRUE);
    }
    foundation::PutLogLevel(7);
    foundation::PutLoggingEnabled(VARIANT_FALSE);
    foundation::GetLogLevel(&level);
    foundation::GetLoggingEnabled(&enabled);
    EXPECT_EQ(std::make_pair(level, enabled), std::make_pair(7, VARIANT_BOOL{VARIANT_FALSE}));
    EXPECT_EQ(foundation::GetLogLevel(nullptr), E_POINTER);
    EXPECT_EQ(foundation::GetLogFolder(nullptr), E_POINTER);
    EXPECT_EQ(foundation::GetLogFilePrefix(nullptr), E_POINTER);
    EXPECT_EQ(foundation::GetLogFileExtension(nullptr), E_POINTER);
    EXPECT_EQ(foundation::GetLoggingEnabled(nullptr), E_POINTER);
}

TEST_F(LoggingControl, NamesAreNullUntilSetAndCopiesAfterwards) {
    BStr stale(OLESTR("stale"));
    BSTR folder = stale.Get();
    ASSERT_EQ(foundation::GetLogFolder(&folder), S_OK);
    EXPECT_EQ(folder, nullptr);  // never set: a null string, not an empty one

    BStr dir("/tmp/ünïcode");
    BStr prefix("");
    foundation::InitializeLogging(dir.Get(), prefix.Get(), nullptr, 2, VARIANT_FALSE);
    BStr gotFolder;
    BStr gotPrefix;
    BStr gotExt;
    ASSERT_EQ(foundation::GetLogFolder(gotFolder.Out()), S_OK);
    ASSERT_EQ(foundation::GetLogFilePrefix(gotPrefix.Out()), S_OK);
    ASSERT_EQ(foundation::GetLogFileExtension(gotExt.Out()), S_OK);
    EXPECT_EQ(gotFolder.Utf8(), "/tmp/ünïcode");
    EXPECT_NE(gotFolder.Get(), dir.Get());
    EXPECT_FALSE(gotPrefix.IsNull());  // an empty string stays distinct from none
    EXPECT_EQ(gotPrefix.Length(), 0u);
    EXPECT_TRUE(gotExt.IsNull());
}

}  // namespace
