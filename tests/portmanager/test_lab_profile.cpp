// `nqpm profile` behind a real NAT: the five mappings are handed out and the SIP server's host
// receives the keep-alives from the NAT's public address.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/kernel.h"
#include "platform/net.h"
#include "tests/support/NatLab.h"
#include "tests/support/os/enter_netns.h"

namespace {

constexpr uint32_t kSipServer = 0xCB007101;  // 203.0.113.1, the lab's server host
constexpr uint16_t kSipPort = 5060;

TEST(LabProfile, MappingsAreHandedOutAndTheSipServerReceivesKeepAlives) {
    if (!testsupport::NatLab::CanRun()) {
        GTEST_SKIP() << "needs root, nftables and stund";
    }
    testsupport::NatLab lab(testsupport::NatLab::UniqueName(21), "full-cone-nat");
    ASSERT_TRUE(lab.Up());
    platform::Socket listener;
    {
        platform::testing::NamedNetnsEntry server(lab.Info("SERVER_NS"));
        ASSERT_TRUE(server.Entered());
        listener = platform::OpenUdpSocket();
        ASSERT_TRUE(platform::BindSocket(listener.Get(), kSipServer, kSipPort));
    }
    const std::string nqpm = std::string(NQPM_BINARY_DIR) + "/bin/nqpm";
    const std::string client = lab.Info("CLIENT_ADDR");
    std::string out;
    const int rc = lab.RunInClient(
        {nqpm, "profile", "--stun", lab.Info("STUN1"), "--no-upnp", "--sip-proxy",
         "203.0.113.1:5060", "--media-proxy", "203.0.113.2", "--address", client + ":5062",
         "--min-port", "20000", "--max-port", "20100", "--ports-per-protocol", "2", "--json"},
        &out);
    EXPECT_EQ(rc, 0) << out;
    const std::string expected =
        "{\"sip\":{\"private\":\"" + client + ":5062\",\"public\":\"198.51.100.254:5062\"}," +
        "\"audio_rtp\":{\"private\":\"" + client +
        ":20004\",\"public\":\"198.51.100.254:20004\"}," + "\"audio_rtcp\":{\"private\":\"" +
        client + ":20001\",\"public\":\"198.51.100.254:20001\"}," +
        "\"video_rtp\":{\"private\":\"" + client +
        ":20008\",\"public\":\"198.51.100.254:20008\"}," + "\"video_rtcp\":{\"private\":\"" +
        client + ":20005\",\"public\":\"198.51.100.254:20005\"}," + "\"hresult\":\"0x00000000\"}\n";
    EXPECT_EQ(out, expected);

    // The first keep-alive of the SIP mapping crossed the NAT from the mapped port.
    ASSERT_EQ(platform::WaitSocketReadable(listener.Get(), 2000), 1);
    unsigned char buf[64];
    uint32_t from = 0;
    uint16_t fromPort = 0;
    const int n = platform::ReceiveFrom(listener.Get(), buf, sizeof buf, &from, &fromPort);
    EXPECT_EQ(std::vector<unsigned char>(buf, buf + std::max(n, 0)),
              (std::vector<unsigned char>{0, 1, 2, 3}));
    EXPECT_EQ(from, 0xC63364FEu);  // 198.51.100.254
    EXPECT_EQ(fromPort, 5062);
}

}  // namespace
