// The proxy's rewrites as tables of datagrams: internal address 10.0.0.5, client port 5062,
// public contact 203.0.113.7:40000, server 198.51.100.20:5060, internal endpoint 10.0.0.5:31000.
#include <gtest/gtest.h>

#include <climits>
#include <string>
#include <vector>

#include "platform/kernel.h"
#include "sipproxy/SipRewriter.h"
#include "sipproxy/SipText.h"

namespace {

using sipproxy::ClientEndpoint;
using sipproxy::SipRewriter;

sipproxy::SipProxyTexts LabTexts() {
    sipproxy::SipProxyTexts t;
    t.m_internalAddress = "10.0.0.5";
    t.m_serverAddress = "198.51.100.20";
    t.m_serverPort = 5060;
    t.m_publicContact = "203.0.113.7:40000";
    t.m_internalEndpoint = "10.0.0.5:31000";
    t.m_mappingPublicAddress = "203.0.113.7";
    return t;
}

enum class From { Client, Server };

struct Case {
    const char* name;
    From from;
    bool registered;  // the client 10.0.0.5:5062 is known already
    std::string in;
    std::string out;
};

void PrintTo(const Case& c, std::ostream* os) {
    *os << c.name;
}

class Rewrite : public ::testing::TestWithParam<Case> {};

TEST_P(Rewrite, GivesTheExpectedDatagram) {
    const Case& c = GetParam();
    SipRewriter r;
    r.SetTexts(LabTexts());
    if (c.registered) {
        r.SetClient(ClientEndpoint{"10.0.0.5", 5062});
    }
    const std::string out =
        c.from == From::Client ? r.RewriteFromClient(c.in) : r.RewriteFromServer(c.in);
    EXPECT_EQ(out, c.out);
}

const std::string kRegister =
    "REGISTER sip:198.51.100.20 SIP/2.0\r\n"
    "Via: SIP/2.0/UDP 10.0.0.5:5062;branch=z9\r\n"
    "Contact: <sip:10.0.0.5:5062>\r\n"
    "Content-Length: 0\r\n\r\n";

INSTANTIATE_TEST_SUITE_P(
    Table, Rewrite,
    ::testing::Values(
        Case{"RegisterViaAndContactBecomePublic", From::Client, false, kRegister,
             "REGISTER sip:198.51.100.20 SIP/2.0\r\n"
             "Via: SIP/2.0/UDP 203.0.113.7:40000;branch=z9\r\n"
             "Contact: <sip:203.0.113.7:40000>\r\n"
             "Content-Length: 0\r\n\r\n"},
        Case{"ViaWithoutPortLeavesUnchanged", From::Client, false,
             "REGISTER sip:198.51.100.20 SIP/2.0\r\nVia: SIP/2.0/UDP 10.0.0.5;branch=z9\r\n"
             "Contact: <sip:10.0.0.5:5062>\r\n\r\n",
             "REGISTER sip:198.51.100.20 SIP/2.0\r\nVia: SIP/2.0/UDP 10.0.0.5;branch=z9\r\n"
             "Contact: <sip:10.0.0.5:5062>\r\n\r\n"},
        Case{"ClientResponseGetsServerViaAndBareContact", From::Client, true,
             "SIP/2.0 200 OK\r\nVia: SIP/2.0/UDP 10.0.0.5:31000;branch=z9\r\n"
             "Contact: \"Bob\" <sip:bob@10.0.0.5:5062>;expires=60\r\nContent-Length: 0\r\n\r\n",
             "SIP/2.0 200 OK\r\nVia: SIP/2.0/UDP 198.51.100.20:5060;branch=z9\r\n"
             "Contact: <sip:203.0.113.7:40000>\r\nContent-Length: 0\r\n\r\n"},
        Case{"RequestWithDigitAtNinthByteTakesResponseBranch", From::Client, true,
             "BYE sip:5000@198.51.100.20 SIP/2.0\r\nVia: SIP/2.0/UDP "
             "10.0.0.5:31000;branch=z9\r\n\r\n",
             "BYE sip:5000@198.51.100.20 SIP/2.0\r\nVia: SIP/2.0/UDP "
             "198.51.100.20:5060;branch=z9\r\n\r\n"},
        Case{"ClientPublicTextInHeadersOnly", From::Client, true,
             "OPTIONS sip:x SIP/2.0\r\nContact: <sip:203.0.113.7:5062>\r\n\r\n203.0.113.7:5062",
             "OPTIONS sip:x SIP/2.0\r\nContact: <sip:203.0.113.7:40000>\r\n\r\n203.0.113.7:5062"},
        Case{"ServerRequestReachesLearnedClient", From::Server, true,
             "INVITE sip:bob@203.0.113.7:40000 SIP/2.0\r\n"
             "Via: SIP/2.0/UDP 198.51.100.20:5060;branch=z9\r\n"
             "Contact: <sip:203.0.113.7:40000>\r\n\r\n",
             "INVITE sip:bob@10.0.0.5:5062 SIP/2.0\r\n"
             "Via: SIP/2.0/UDP 10.0.0.5:31000;branch=z9\r\n"
             "Contact: <sip:10.0.0.5:5062>\r\n\r\n"},
        Case{"ServerRequestBeforeAnyRegister", From::Server, false,
             "NOTIFY sip:x SIP/2.0\r\nContact: <sip:203.0.113.7:40000>\r\n\r\n",
             "NOTIFY sip:x SIP/2.0\r\nContact: <sip::0>\r\n\r\n"},
        Case{"BareServerHostButNotReceivedNorCallId", From::Server, true,
             "SIP/2.0 200 OK\r\nVia: SIP/2.0/UDP 10.0.0.5:31000;received=198.51.100.20;x\r\n"
             "Record-Route: <sip:198.51.100.20;lr>\r\nVia: SIP/2.0/UDP 198.51.100.20\r\n"
             "Call-ID: 1-42@198.51.100.20\r\ni: 2@198.51.100.20;x\r\n\r\n",
             "SIP/2.0 200 OK\r\nVia: SIP/2.0/UDP 10.0.0.5:31000;received=198.51.100.20;x\r\n"
             "Record-Route: <sip:10.0.0.5:31000;lr>\r\nVia: SIP/2.0/UDP 10.0.0.5:31000\r\n"
             "Call-ID: 1-42@198.51.100.20\r\ni: 2@198.51.100.20;x\r\n\r\n"},
        Case{"ServerBodyIsNotSearched", From::Server, true,
             "MESSAGE sip:x SIP/2.0\r\nContent-Length: 54\r\n\r\n"
             "203.0.113.7:40000 198.51.100.20:5060 198.51.100.20;lr",
             "MESSAGE sip:x SIP/2.0\r\nContent-Length: 54\r\n\r\n"
             "203.0.113.7:40000 198.51.100.20:5060 198.51.100.20;lr"},
        Case{"StopEndsNothingButIsEmptyFromClient", From::Client, false, "STOP", ""},
        Case{"StopEndsNothingButIsEmptyFromServer", From::Server, false, "STOP", ""},
        Case{"StopWithLineEndIsForwardedFromClient", From::Client, false, "STOP\r\n", "STOP\r\n"},
        Case{"StopWithLineEndIsForwardedFromServer", From::Server, false, "STOP\r\n", "STOP\r\n"},
        Case{"WithoutHeaderEndRewritesEverything", From::Client, false,
             "REGISTER sip:x SIP/2.0\r\nVia: SIP/2.0/UDP 10.0.0.5:5062",
             "REGISTER sip:x SIP/2.0\r\nVia: SIP/2.0/UDP 203.0.113.7:40000"},
        Case{"BodyLengthChangeCorrectsContentLength", From::Client, false,
             "INVITE sip:x SIP/2.0\r\nVia: SIP/2.0/UDP 10.0.0.5:5062;branch=z9\r\n"
             "Content-Length:  22\r\nl:22\r\n\r\nc=IN IP4 10.0.0.5:5062",
             "INVITE sip:x SIP/2.0\r\nVia: SIP/2.0/UDP 203.0.113.7:40000;branch=z9\r\n"
             "Content-Length:  26\r\nl:26\r\n\r\nc=IN IP4 203.0.113.7:40000"},
        Case{"UnchangedBodyLeavesContentLengthAsItWas", From::Client, false,
             "INVITE sip:x SIP/2.0\r\nVia: SIP/2.0/UDP 10.0.0.5:5062;branch=z9\r\n"
             "Content-Length: 999\r\n\r\nv=0",
             "INVITE sip:x SIP/2.0\r\nVia: SIP/2.0/UDP 203.0.113.7:40000;branch=z9\r\n"
             "Content-Length: 999\r\n\r\nv=0"}),
    [](const ::testing::TestParamInfo<Case>& info) { return std::string(info.param.name); });

TEST(RewriteLearning, RegisterTeachesTheClientAndOtherRequestsDoNot) {
    SipRewriter r;
    r.SetTexts(LabTexts());
    r.RewriteFromClient("INVITE sip:x SIP/2.0\r\nVia: SIP/2.0/UDP 10.0.0.5:5999;branch=z9\r\n\r\n");
    EXPECT_EQ(r.Client().m_clientPort, 0);
    r.RewriteFromClient(kRegister);
    EXPECT_EQ(r.Client().m_clientAddress, "10.0.0.5");
    EXPECT_EQ(r.Client().m_clientPort, 5062);
    // A re-registration from another port moves the client.
    r.RewriteFromClient(
        "REGISTER sip:x SIP/2.0\r\nVia: SIP/2.0/UDP 10.0.0.5:5070;branch=z9\r\n\r\n");
    EXPECT_EQ(r.Client().m_clientPort, 5070);
}

TEST(RewriteLearning, MessageWithoutHeaderEndGoesToTheDebuggerOutput) {
    std::vector<std::string> lines;
    platform::SetDebugOutputSink([&](std::string_view line) { lines.emplace_back(line); });
    SipRewriter r;
    r.SetTexts(LabTexts());
    r.RewriteFromServer("binary\x01 no header end");
    r.RewriteFromServer("OPTIONS sip:x SIP/2.0\r\n\r\n");
    platform::SetDebugOutputSink(nullptr);
    ASSERT_FALSE(lines.empty());
    for (const std::string& line : lines) {
        EXPECT_EQ(line, "binary\x01 no header end");
    }
}

TEST(SipText, ReplaceAllNeverSearchesInsertedTextAndIgnoresAnEmptyPattern) {
    EXPECT_EQ(sipproxy::ReplaceAll("a-a", "a", "aa"), "aa-aa");
    EXPECT_EQ(sipproxy::ReplaceAll("aaa", "aa", "b"), "ba");
    EXPECT_EQ(sipproxy::ReplaceAll("abc", "", "x"), "abc");
    EXPECT_EQ(sipproxy::ReplaceBareHost("abc;abc;", "", "x"), "abc;abc;");
}

TEST(SipText, ReplaceBareHostKeepsPortsParametersValuesAndTheEnds) {
    const std::string p = "1.2.3.4;";
    const std::string r = "5.6.7.8:9;";
    EXPECT_EQ(sipproxy::ReplaceBareHost("<sip:1.2.3.4;lr>", p, r), "<sip:5.6.7.8:9;lr>");
    EXPECT_EQ(sipproxy::ReplaceBareHost("1.2.3.4;x", p, r), "1.2.3.4;x");      // position 0
    EXPECT_EQ(sipproxy::ReplaceBareHost(" 1.2.3.4;x", p, r), " 1.2.3.4;x");    // position 1
    EXPECT_EQ(sipproxy::ReplaceBareHost("a=1.2.3.4;x", p, r), "a=1.2.3.4;x");  // a value
    EXPECT_EQ(sipproxy::ReplaceBareHost("ab 1.2.3.4;", p, r), "ab 1.2.3.4;");  // at the end
    EXPECT_EQ(sipproxy::ReplaceBareHost("ab 1.2.3.4;:", p, r), "ab 1.2.3.4;:");
    EXPECT_EQ(sipproxy::ReplaceBareHost("ab 1.2.3.4;;dstport", p, r), "ab 1.2.3.4;;dstport");
    // Only the Call-ID line keeps its host, whatever lines come before and after it.
    EXPECT_EQ(sipproxy::ReplaceBareHost("x\r\ni : a@1.2.3.4;b\r\nVia: 1.2.3.4;c 1.2.3.4;d\r\n"
                                        "no colon 1.2.3.4;e",
                                        p, r),
              "x\r\ni : a@1.2.3.4;b\r\nVia: 5.6.7.8:9;c 5.6.7.8:9;d\r\nno colon 5.6.7.8:9;e");
    // A replacement that holds its pattern is not searched again.
    EXPECT_EQ(sipproxy::ReplaceBareHost("ab 1.2.3.4;x 1.2.3.4;y", p, "x1.2.3.4;"),
              "ab x1.2.3.4;x x1.2.3.4;y");
}

TEST(SipText, SplitHostPortAndIsRegister) {
    EXPECT_EQ(sipproxy::SplitHostPort("198.51.100.20").port, 5060);
    EXPECT_EQ(sipproxy::SplitHostPort("198.51.100.20:5070").port, 5070);
    EXPECT_EQ(sipproxy::SplitHostPort("198.51.100.20:5070").host, "198.51.100.20");
    EXPECT_EQ(sipproxy::SplitHostPort("h:x").port, 0);
    EXPECT_EQ(sipproxy::SplitHostPort("h:99999999999999999999").port, INT32_MAX);
    EXPECT_TRUE(sipproxy::IsRegister("REGISTER"));
    EXPECT_FALSE(sipproxy::IsRegister("REGISTE"));
    EXPECT_FALSE(sipproxy::IsRegister("register sip:x"));
}

}  // namespace
