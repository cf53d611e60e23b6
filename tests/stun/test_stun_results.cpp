#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "stun/STUNResults.h"

namespace {

using namespace stun;

STUNResultList One(uint32_t local, uint8_t result, uint32_t publicAddress) {
    STUNResultList list;
    list.count = 1;
    list.entries[0] = {local, result, publicAddress};
    return list;
}

TEST(FormatSTUNResults, EveryResultValue) {
    const struct {
        uint8_t result;
        const char* text;
    } cases[] = {
        {0, "private IP: 10.0.0.5, STUN_RESULT_UNKNOWN."},
        {1, "private IP: 10.0.0.5, STUN_RESULT_OPEN: , public IP: 1.2.3.4"},
        {2, "private IP: 10.0.0.5, STUN_RESULT_FULL_CONE_FIREWALL: , public IP: 1.2.3.4"},
        {3, "private IP: 10.0.0.5, STUN_RESULT_FULL_CONE_NAT: , public IP: 1.2.3.4"},
        {4, "private IP: 10.0.0.5, STUN_RESULT_RESTRICTED_CONE_NAT: , public IP: 1.2.3.4"},
        {5, "private IP: 10.0.0.5, STUN_RESULT_PORT_RESTRICTED_CONE_NAT: , public IP: 1.2.3.4"},
        {6, "private IP: 10.0.0.5, STUN_RESULT_SYMMETRIC_FIREWALL: , public IP: 1.2.3.4"},
        {7, "private IP: 10.0.0.5, STUN_RESULT_SYMMETRIC_NAT: "},
        {8, "private IP: 10.0.0.5, STUN_RESULT_BLOCKED: "},
        {9, "private IP: 10.0.0.5, invalid STUN result!!!: "},
        {255, "private IP: 10.0.0.5, invalid STUN result!!!: "},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(FormatSTUNResults(One(0x0A000005, c.result, 0x01020304)), c.text)
            << int{c.result};
    }
}

TEST(FormatSTUNResults, EntriesFollowEachOtherAndTheCountIsBounded) {
    STUNResultList list;
    EXPECT_EQ(FormatSTUNResults(list), "");
    list.count = 2;
    list.entries[0] = {0xC0A80001, STUN_RESULT_BLOCKED, kNoPublicAddress};
    list.entries[1] = {0x0A000001, STUN_RESULT_UNKNOWN, kNoPublicAddress};
    EXPECT_EQ(FormatSTUNResults(list),
              "private IP: 192.168.0.1, STUN_RESULT_BLOCKED: private IP: 10.0.0.1, "
              "STUN_RESULT_UNKNOWN.");
    // A count beyond the entries that exist never reads past them.
    list.count = 1000;
    const std::string text = FormatSTUNResults(list);
    size_t entries = 0;
    for (size_t at = text.find("private IP"); at != std::string::npos;
         at = text.find("private IP", at + 1)) {
        ++entries;
    }
    EXPECT_EQ(entries, kMaxSTUNResults);
    list.count = -3;
    EXPECT_EQ(FormatSTUNResults(list), "");
}

TEST(FormatHostOrderAddress, MostSignificantByteFirstWithoutLeadingZeros) {
    EXPECT_EQ(FormatHostOrderAddress(0xC0A80001), "192.168.0.1");
    EXPECT_EQ(FormatHostOrderAddress(0), "0.0.0.0");
    EXPECT_EQ(FormatHostOrderAddress(0xFFFFFFFF), "255.255.255.255");
}

std::string Token(const char* list, int index, size_t capacity = 256) {
    char buffer[256];
    std::memset(buffer, 'x', sizeof buffer);
    EXPECT_TRUE(GetListToken(list, index, buffer, capacity));
    return buffer;
}

TEST(GetListToken, SplitsLikeStrtokOnCommasAndCutsToTheBuffer) {
    EXPECT_EQ(Token(",,stun.example.net", 0), "stun.example.net");
    EXPECT_EQ(Token(",,stun.example.net", 1), "");
    EXPECT_EQ(Token("a, b", 0), "a");
    EXPECT_EQ(Token("a, b", 1), " b");  // blanks are kept
    EXPECT_EQ(Token("a,,b,", 1), "b");
    EXPECT_EQ(Token("a,b", 2), "");
    EXPECT_EQ(Token("", 0), "");
    EXPECT_EQ(Token("a,b", -1), "");
    // Cut to the buffer; missing arguments refused.
    EXPECT_EQ(Token("abcdef,g", 0, 4), "abc");
    EXPECT_EQ(Token("abcdef,g", 1, 1), "");
    char buffer[4];
    EXPECT_FALSE(GetListToken(nullptr, 0, buffer, sizeof buffer));
    EXPECT_FALSE(GetListToken("a", 0, nullptr, 4));
    EXPECT_FALSE(GetListToken("a", 0, buffer, 0));
}

}  // namespace
