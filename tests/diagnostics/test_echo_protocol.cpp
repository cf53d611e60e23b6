#include <gtest/gtest.h>

#include <climits>

#include "diagnostics/EchoProtocol.h"

namespace {

using namespace diagnostics;

TEST(EchoProtocol, MediaPayloadOfATenCharacterIdAndOfAnIdTooLongToFit) {
    const std::string payload = MakeMediaPayload("0123456789");
    ASSERT_EQ(payload.size(), kMediaPayloadSize);
    EXPECT_EQ(payload.substr(0, 21), "Call-ID: 0123456789\r\n");
    EXPECT_EQ(static_cast<uint8_t>(payload[21]), 0x15);
    EXPECT_EQ(static_cast<uint8_t>(payload[22]), 0x17);
    EXPECT_EQ(static_cast<uint8_t>(payload[23]), 0x17);
    EXPECT_EQ(static_cast<uint8_t>(payload[24]), 0x19);
    EXPECT_EQ(static_cast<uint8_t>(payload[1397]), 0x75);  // 1397 | 1 = 0x575
    EXPECT_EQ(payload.find('\0'), std::string::npos);

    const std::string longId(5000, 'k');
    const std::string cut = MakeMediaPayload(longId);
    ASSERT_EQ(cut.size(), kMediaPayloadSize);
    EXPECT_EQ(cut, ("Call-ID: " + longId).substr(0, kMediaPayloadSize));
}

TEST(EchoProtocol, SamplesKeepTheirSizesAndTakeTheSessionIdOnce) {
    const std::string_view samples[] = {SipRegisterRequest(), SipRegisterResponse(),
                                        SipInviteRequest(), SipInviteResponse()};
    for (std::string_view sample : samples) {
        const std::string message = WithSessionId(sample, " abc");
        EXPECT_EQ(message.size(), sample.size() - kSampleCallId.size() + 4);
        EXPECT_NE(message.find("Call-ID:  abc\r\n"), std::string::npos);
        EXPECT_EQ(message.find(kSampleCallId), std::string::npos);
    }
    EXPECT_EQ(WithSessionId("no id here", "x"), "no id here");
}

TEST(EchoProtocol, LoginReplyValuesAreUntrimmedTextsAndAtolNumbers) {
    EchoLogin login;
    EXPECT_EQ(ParseLoginReply("Status: 200\r\nSession-Id: s1\r\nSIP-Port: 70000x\r\n"
                              "Audio-RTP-Port:\t 5004\r\nAudio-RTCP-Port: 5005\r\n"
                              "Video-RTP-Port: 5006\r\nVideo-RTCP-Port: 5007",
                              login),
              0);
    EXPECT_EQ(login.m_sessionId, " s1");
    EXPECT_EQ(login.m_sipPort, static_cast<uint16_t>(70000));
    EXPECT_EQ(login.m_audioRtpPort, 5004);
    EXPECT_EQ(login.m_videoRtcpPort, 5007);
    // Names are case-sensitive; a status needs its value.
    EXPECT_EQ(ParseLoginReply("status: 200\r\n", login), 17);
    EXPECT_EQ(ParseLoginReply("Status: 20\r\n0", login), 18);
    EXPECT_EQ(ParseLoginReply("Status: 200\r\nSession-ID: x\r\n", login), 19);
}

TEST(EchoProtocol, ReportNeedsLengthLineAndBlankLine) {
    const struct {
        std::string_view text;
        bool parsed;
        long length;
        size_t offset;
    } cases[] = {
        {"Content-Length: 5\r\n\r\nhello", true, 5, 21},
        {"X: y\r\nContent-Length:  12\r\nA: b\r\n\r\n", true, 12, 35},
        {"Content-Length: 5\r\n", false, 0, 0},
        {"Content-Length: 5", false, 0, 0},
        {"Content-length: 5\r\n\r\n", false, 0, 0},
        {"\r\n\r\nContent-Length: 5\r\n", false, 0, 0},
        {"Content-Length: 99999999999999999999999\r\n\r\n", true, LONG_MAX, 43},
    };
    for (const auto& c : cases) {
        const auto report = ParseEchoReport(c.text);
        ASSERT_EQ(report.has_value(), c.parsed) << c.text;
        if (report) {
            EXPECT_EQ(report->m_length, c.length) << c.text;
            EXPECT_EQ(report->m_payloadOffset, c.offset) << c.text;
        }
    }
}

}  // namespace
