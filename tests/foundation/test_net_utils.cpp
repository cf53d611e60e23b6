#include <gtest/gtest.h>

#include <mutex>
#include <string>
#include <vector>

#include "foundation/Logger.h"
#include "foundation/NetUtils.h"
#include "foundation/NetworkEndpoint.h"
#include "foundation/UdpSocket.h"
#include "platform/kernel.h"
#include "platform/net.h"
#include "platform/netinfo.h"
#include "tests/support/DnsLab.h"
#include "tests/support/FakeNetworkInfo.h"
#include "tests/support/LogCapture.h"

namespace {

using foundation::CreateUdpSocket;
using foundation::GetIPByName;
using foundation::kAddressNone;
using foundation::ReceiveDatagram;
using foundation::SendDatagram;

constexpr uint32_t kLoopback = 0x7F000001;

uint16_t PortOf(const platform::Socket& s) {
    uint16_t port = 0;
    platform::GetSocketName(s.Get(), nullptr, &port);
    return port;
}

TEST(GetIPByName, DottedQuadIsTakenAsIsAndLocalhostResolves) {
    const uint32_t a = GetIPByName("10.1.2.3");
    EXPECT_EQ(platform::NetToHost32(a), 0x0A010203u);
    EXPECT_EQ(GetIPByName("10.1.2.3", kAddressNone), a);
    EXPECT_EQ(platform::NetToHost32(GetIPByName("localhost")), kLoopback);
}

TEST(CreateUdpSocket, RotatingPortsContinueSkipTakenOnesAndWrapFrom60000To10000) {
    foundation::RotatingPort ports(40000);
    uint16_t first = 0;
    platform::Socket a(CreateUdpSocket(kLoopback, &first, ports));
    // A taken rotating candidate is skipped.
    foundation::RotatingPort again(first);
    uint16_t second = 0;
    platform::Socket b(CreateUdpSocket(kLoopback, &second, again));
    ASSERT_TRUE(a.IsValid() && b.IsValid());
    EXPECT_GE(first, 40000);
    EXPECT_GT(second, first);
    EXPECT_EQ(std::make_pair(PortOf(a), PortOf(b)), std::make_pair(first, second));
    EXPECT_EQ(again.Next(), second + 1);
    // An absent port still advances the sequence without reporting it.
    platform::Socket c(CreateUdpSocket(kLoopback, nullptr, again));
    EXPECT_GT(PortOf(c), second);
    // A taken exact port fails at once and leaves the sequence alone.
    uint16_t taken = first;
    EXPECT_FALSE(CreateUdpSocket(kLoopback, &taken, ports).IsValid());
    EXPECT_EQ(taken, first);
    EXPECT_EQ(ports.Next(), first + 1);

    foundation::RotatingPort wrapping(60000);
    platform::Socket probe(platform::OpenUdpSocket());
    if (!platform::BindSocket(probe.Get(), kLoopback, 60000)) {
        GTEST_SKIP() << "port 60000 is in use on this machine";
    }
    probe.Close();
    uint16_t port = 0;
    platform::Socket s(CreateUdpSocket(kLoopback, &port, wrapping));
    EXPECT_EQ(port, 60000);
    EXPECT_EQ(wrapping.Next(), 10000);
}

TEST(ReceiveDatagram, TimesOutReportsTheSenderAndRefusesAnOversizedDatagram) {
    uint16_t rxPort = 0;
    platform::Socket rx(CreateUdpSocket(kLoopback, &rxPort));
    uint16_t txPort = 0;
    platform::Socket tx(CreateUdpSocket(kLoopback, &txPort));
    char buf[10] = {};
    uint32_t from = 0xDEADBEEF;
    uint16_t fromPort = 0xBEEF;
    EXPECT_EQ(ReceiveDatagram(rx.Get(), buf, sizeof buf, &from, &fromPort, 0), 0);
    const uint64_t start = platform::GetTickCount64();
    EXPECT_EQ(ReceiveDatagram(rx.Get(), buf, sizeof buf, &from, &fromPort, 300), 0);
    const uint64_t spent = platform::GetTickCount64() - start;
    EXPECT_GE(spent, 290u);
    EXPECT_LT(spent, 1300u);
    EXPECT_EQ(std::make_pair(from, fromPort), std::make_pair(0xDEADBEEFu, uint16_t{0xBEEF}));

    const char payload[] = {0, 1, 2, 3};
    ASSERT_EQ(SendDatagram(tx.Get(), payload, sizeof payload, kLoopback, rxPort), 4);
    ASSERT_EQ(ReceiveDatagram(rx.Get(), buf, sizeof buf, &from, &fromPort, 1000), 4);
    EXPECT_EQ(std::make_pair(from, fromPort), std::make_pair(kLoopback, txPort));
    EXPECT_EQ(std::string(buf, 4), std::string(payload, 4));

    const std::string big(100, 'b');
    SendDatagram(tx.Get(), big.data(), big.size(), kLoopback, rxPort);
    fromPort = 0;
    EXPECT_EQ(ReceiveDatagram(rx.Get(), buf, sizeof buf, &from, &fromPort, 1000),
              platform::kSocketError);
    EXPECT_EQ(platform::LastSocketError(), platform::kErrMessageSize);
    EXPECT_EQ(fromPort, 0);
}

TEST(NetworkEndpoint, TextCarriesBothLabelsEvenWhenTheAddressIsEmpty) {
    EXPECT_EQ(foundation::NetworkEndpoint("192.0.2.10", 5062).ToString(),
              "m_address= 192.0.2.10, m_port=5062");
    EXPECT_EQ(foundation::NetworkEndpoint("", -1).ToString(), "m_address= , m_port=-1");
}

TEST(UdpSocket, ClosedObjectReturnsAtOnceAndRefusesToSend) {
    foundation::UdpSocket s;
    std::string from = "unchanged";
    uint16_t port = 7;
    const uint64_t start = platform::GetTickCount64();
    EXPECT_EQ(s.Receive(from, port), "");
    EXPECT_LT(platform::GetTickCount64() - start, 100u);
    EXPECT_EQ(from, "unchanged");
    EXPECT_EQ(port, 7);
    EXPECT_FALSE(s.SendTo("x", kLoopback, 9));
    EXPECT_EQ(s.LocalAddress(), kAddressNone);
    EXPECT_EQ(s.LocalAddressText(), "");
}

TEST(UdpSocket, RoundTripKeepsZeroBytesAndReportsTheEndpoints) {
    foundation::UdpSocket rx;
    ASSERT_TRUE(rx.Open("127.0.0.1", 0, 0, false));
    EXPECT_NE(rx.LocalPort(), 0);
    EXPECT_EQ(rx.LocalAddressText(), "127.0.0.1");
    EXPECT_EQ(rx.LocalEndpointText(), "127.0.0.1:" + std::to_string(rx.LocalPort()));
    foundation::UdpSocket tx;
    ASSERT_TRUE(tx.Open());
    const std::string payload("a\0b\0", 4);
    ASSERT_TRUE(tx.SendTo(payload, "localhost", rx.LocalPort()));
    std::string from;
    uint16_t fromPort = 0;
    EXPECT_EQ(rx.Receive(from, fromPort), payload);
    EXPECT_EQ(from, "127.0.0.1");
    EXPECT_EQ(fromPort, tx.LocalPort());
    foundation::UdpSocket exact;  // the exact port is the only one tried
    EXPECT_FALSE(exact.Open("127.0.0.1", rx.LocalPort()));
    EXPECT_FALSE(exact.IsValid());
    rx.Close();
    EXPECT_EQ(rx.LocalPort(), 0);
    EXPECT_FALSE(rx.IsValid());
}

TEST(AdapterQueries, GatewaysAddressesAndTheUdpCounterFromTheAdapterList) {
    testsupport::FakeNetworkInfo fake;
    fake.adapters = {{1, "lo", {"127.0.0.1"}, ""},
                     {2, "eth0", {"10.0.0.2", "10.0.0.3"}, "10.0.0.1"},
                     {3, "eth1", {"10.0.0.3"}, "10.0.0.254"},
                     {4, "eth2", {"192.0.2.5"}, ""}};
    // The first adapter whose primary address matches, byte by byte; a secondary one does not.
    EXPECT_EQ(foundation::GetGatewayForLocalAddress("10.0.0.2", fake), "10.0.0.1");
    EXPECT_EQ(foundation::GetGatewayForLocalAddress("10.0.0.3", fake), "10.0.0.254");
    EXPECT_EQ(foundation::GetGatewayForLocalAddress("192.0.2.5", fake), "");
    EXPECT_EQ(foundation::GetGatewayForLocalAddress("10.0.0.02", fake), "");
    std::string address = "x";
    std::string gateway = "y";
    EXPECT_FALSE(foundation::GetInterfaceAddressAndGateway(4, address, gateway, fake));
    EXPECT_EQ(address, "x");
    ASSERT_TRUE(foundation::GetInterfaceAddressAndGateway(3, address, gateway, fake));
    EXPECT_EQ(address + " " + gateway, "10.0.0.3 10.0.0.254");
    uint32_t count = 0;
    EXPECT_EQ(foundation::QueryUdpInDatagrams(&count, fake), 0);
    EXPECT_EQ(count, 42u);
    fake.udpError = 0x12345;
    EXPECT_EQ(static_cast<uint32_t>(foundation::QueryUdpInDatagrams(&count, fake)), 0x80072345u);
    EXPECT_EQ(count, 42u);
    fake.ok = false;
    EXPECT_EQ(foundation::GetGatewayForLocalAddress("10.0.0.2", fake), "");
}

TEST(SystemNetworkInfo, LoopbackHasNoGatewayAndTheUdpCounterGrows) {
    std::vector<platform::AdapterInfo> adapters;
    ASSERT_TRUE(platform::SystemNetworkInfo().Adapters(adapters));
    int loopbacks = 0;
    for (const auto& a : adapters) {
        if (!a.addresses.empty() && a.addresses.front() == "127.0.0.1") {
            ++loopbacks;
            EXPECT_EQ(a.gateway, "");
            EXPECT_NE(a.index, 0u);
        }
    }
    EXPECT_EQ(loopbacks, 1);
    uint32_t before = 0;
    ASSERT_EQ(foundation::QueryUdpInDatagrams(&before), 0);
    uint16_t rxPort = 0;
    platform::Socket rx(CreateUdpSocket(kLoopback, &rxPort));
    platform::Socket tx(CreateUdpSocket(kLoopback, nullptr));
    SendDatagram(tx.Get(), "x", 1, kLoopback, rxPort);
    char buf[4];
    ASSERT_EQ(ReceiveDatagram(rx.Get(), buf, sizeof buf, nullptr, nullptr, 1000), 1);
    uint32_t after = 0;
    ASSERT_EQ(foundation::QueryUdpInDatagrams(&after), 0);
    EXPECT_GT(after, before);
}

}  // namespace

namespace {

// Name look-ups against a name server of the test's own.

TEST(LabDns, UnknownNameGivesEachVariantsNotFoundValueWithoutLogging) {
    NQPM_RUN_INSIDE_DNS_LAB("LabDns.UnknownNameGivesEachVariantsNotFoundValueWithoutLogging")
    testsupport::LogCapture log;
    EXPECT_EQ(platform::NetToHost32(GetIPByName(testsupport::DnsLab::kKnownName)), kLoopback);
    EXPECT_EQ(GetIPByName(testsupport::DnsLab::kUnknownName), 0u);
    EXPECT_EQ(GetIPByName(testsupport::DnsLab::kUnknownName, kAddressNone), kAddressNone);
    EXPECT_TRUE(log.Lines().empty());
}

}  // namespace
