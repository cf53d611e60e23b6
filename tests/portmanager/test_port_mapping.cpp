// Mapping records, their placeholder socket and the keep-alive, observed on loopback.
#include <gtest/gtest.h>

#include <cerrno>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/net.h"
#include "portmanager/PortMapping.h"
#include "portmanager/PortMappingPool.h"
#include "tests/portmanager/port_mapping_test_support.h"

namespace portmanager {
namespace {

using testing::kLoopback;
using testing::kLoopbackHost;
using testing::LogCapture;
using testing::LoopbackSocket;

const std::vector<uint8_t> kKeepAliveBytes = {0x00, 0x01, 0x02, 0x03};
constexpr const char* kRefreshTag = "PortMapping::Refresh";

TEST(PortMappingText, RecordsReadAsTheLogShowsThem) {
    struct Case {
        PortMapping mapping;
        const char* local;
        const char* full;
    };
    MappedServiceEndpoint withSocket({"10.1.2.3", 40000}, {"host.example", -1});
    withSocket.m_socket = 7;  // never shown
    const Case cases[] = {
        {PortMapping(MappedServiceEndpoint({"192.0.2.10", 5062}, {"198.51.100.7", 5062}),
                     {"203.0.113.9", 5060}),
         "m_private = (m_address= 192.0.2.10, m_port=5062), m_public=(m_address= 198.51.100.7, "
         "m_port=5062)",
         "m_local=(m_private = (m_address= 192.0.2.10, m_port=5062), m_public=(m_address= "
         "198.51.100.7, m_port=5062)), m_remote=(m_address= 203.0.113.9, m_port=5060)"},
        {PortMapping(), "m_private = (m_address= , m_port=0), m_public=(m_address= , m_port=0)",
         "m_local=(m_private = (m_address= , m_port=0), m_public=(m_address= , m_port=0)), "
         "m_remote=(m_address= , m_port=0)"},
        {PortMapping(withSocket, {"sip.example.org", 65536}),
         "m_private = (m_address= 10.1.2.3, m_port=40000), m_public=(m_address= host.example, "
         "m_port=-1)",
         "m_local=(m_private = (m_address= 10.1.2.3, m_port=40000), m_public=(m_address= "
         "host.example, m_port=-1)), m_remote=(m_address= sip.example.org, m_port=65536)"},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(c.mapping.m_local.ToString(), c.local);
        EXPECT_EQ(c.mapping.ToString(), c.full);
    }
}

TEST(MappedServiceEndpoint, CopiesShareTheHandleAndNeverCloseIt) {
    const int before = platform::CountOpenDescriptors();
    MappedServiceEndpoint original({kLoopback, 0}, {"198.51.100.7", 0});
    EXPECT_EQ(original.m_socket, platform::kInvalidSocket);
    ASSERT_TRUE(original.Open(true));
    const int32_t port = original.m_private.m_port;
    {
        const MappedServiceEndpoint copy = original;
        const PortMapping mapping(copy, {kLoopback, 5060});
        EXPECT_EQ(copy.m_socket, original.m_socket);
        EXPECT_EQ(mapping.m_local.m_socket, original.m_socket);
    }
    // Both copies are gone, the placeholder still holds the port.
    EXPECT_EQ(platform::CountOpenDescriptors(), before + 1);
    EXPECT_FALSE(LoopbackSocket(static_cast<uint16_t>(port)).IsBound());

    original.Close();
    EXPECT_EQ(original.m_socket, platform::kInvalidSocket);
    EXPECT_EQ(platform::CountOpenDescriptors(), before);
    EXPECT_TRUE(LoopbackSocket(static_cast<uint16_t>(port)).IsBound());
}

TEST(MappedServiceEndpoint, OpenBindsThePrivatePortAndCopiesItToThePublicOne) {
    const auto base = testing::FindFreeWindow(1);
    if (!base) {
        GTEST_SKIP() << "no free loopback port";
    }
    struct Case {
        bool anyPort;
        int32_t port;
    };
    for (const Case c : {Case{false, *base}, Case{true, 0}, Case{true, *base}}) {
        MappedServiceEndpoint mapping({kLoopback, c.port}, {"198.51.100.7", 1});
        ASSERT_TRUE(mapping.Open(c.anyPort)) << c.anyPort;
        EXPECT_NE(mapping.m_socket, platform::kInvalidSocket);
        if (!c.anyPort) {
            EXPECT_EQ(mapping.m_private.m_port, *base);
        }
        EXPECT_NE(mapping.m_private.m_port, 0);
        EXPECT_EQ(mapping.m_public.m_port, mapping.m_private.m_port);
        EXPECT_EQ(mapping.m_public.m_address, "198.51.100.7");
        EXPECT_FALSE(LoopbackSocket(static_cast<uint16_t>(mapping.m_private.m_port)).IsBound());
        mapping.Close();
    }
}

TEST(MappedServiceEndpoint, OpenFailsWithoutLeavingASocket) {
    const auto base = testing::FindFreeWindow(3);
    if (!base) {
        GTEST_SKIP() << "no free loopback ports";
    }
    // The placeholder sets no option, so even a holder that allows reuse keeps it out.
    const LoopbackSocket plainHolder(static_cast<uint16_t>(*base));
    const LoopbackSocket reuseHolder(static_cast<uint16_t>(*base + 1), true);
    ASSERT_TRUE(plainHolder.IsBound());
    ASSERT_TRUE(reuseHolder.IsBound());
    const int32_t freePort = *base + 2;
    struct Case {
        const char* name;
        std::string address;
        int32_t port;
    };
    const Case cases[] = {
        {"held port", kLoopback, *base},
        {"held by a reusing socket", kLoopback, *base + 1},
        {"host name, not looked up", "localhost", freePort},
        {"negative port", kLoopback, -1},
        {"port that would wrap onto a free one", kLoopback, freePort + 65536},
    };
    const int before = platform::CountOpenDescriptors();
    for (const Case& c : cases) {
        MappedServiceEndpoint mapping({c.address, c.port}, {"198.51.100.7", 9});
        EXPECT_FALSE(mapping.Open(false)) << c.name;
        EXPECT_EQ(mapping.m_socket, platform::kInvalidSocket) << c.name;
        EXPECT_EQ(mapping.m_private.m_port, c.port) << c.name;
        EXPECT_EQ(mapping.m_public.m_port, 9) << c.name;
        EXPECT_EQ(platform::CountOpenDescriptors(), before) << c.name;
    }
    EXPECT_TRUE(LoopbackSocket(static_cast<uint16_t>(freePort)).IsBound());
}

// A listener on loopback and the log, for watching keep-alives.
class RefreshTest : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_TRUE(m_listener.IsBound());
        const auto base = testing::FindFreeWindow(3);
        if (!base) {
            GTEST_SKIP() << "no free loopback ports";
        }
        m_port = *base;
        m_sentinelPort = *base + 2;
    }

    PortMapping MappingFrom(int32_t localPort, std::string localAddress = kLoopback) const {
        return PortMapping(MappedServiceEndpoint({std::move(localAddress), localPort},
                                                 {"198.51.100.7", localPort}),
                           {kLoopback, m_listener.Port()});
    }

    // A keep-alive that must arrive: whatever the listener got before it was sent by the test's
    // subject, so "nothing was sent" needs no waiting for silence.
    void ExpectNextDatagramIsTheSentinel() {
        MappingFrom(m_sentinelPort).Refresh();
        const auto datagram = m_listener.Receive();
        ASSERT_TRUE(datagram.has_value());
        EXPECT_EQ(datagram->fromPort, m_sentinelPort);
    }

    LogCapture m_log;
    LoopbackSocket m_listener;
    int32_t m_port = 0;
    int32_t m_sentinelPort = 0;
};

TEST_F(RefreshTest, SendsTheKeepAliveFromTheMappedPortAndLogsIt) {
    const int before = platform::CountOpenDescriptors();
    const PortMapping mapping = MappingFrom(m_port);
    mapping.Refresh();

    const auto datagram = m_listener.Receive();
    ASSERT_TRUE(datagram.has_value());
    EXPECT_EQ(datagram->bytes, kKeepAliveBytes);
    EXPECT_EQ(datagram->fromAddress, kLoopbackHost);
    EXPECT_EQ(datagram->fromPort, m_port);
    EXPECT_EQ(platform::CountOpenDescriptors(), before);

    const auto lines = m_log.LinesOf(kRefreshTag);
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].level, "DEBUG");
    EXPECT_EQ(lines[0].message, "Succeeded - " + mapping.ToString());
}

TEST_F(RefreshTest, ClientSocketThatAllowsReuseSharesThePort) {
    const LoopbackSocket client(static_cast<uint16_t>(m_port), true);
    ASSERT_TRUE(client.IsBound());
    MappingFrom(m_port).Refresh();

    const auto datagram = m_listener.Receive();
    ASSERT_TRUE(datagram.has_value());
    EXPECT_EQ(datagram->bytes, kKeepAliveBytes);
    EXPECT_EQ(datagram->fromPort, m_port);
}

TEST_F(RefreshTest, SkipsSilentlyWhatCannotBeSent) {
    const int32_t listenerPort = m_listener.Port();
    struct Case {
        const char* name;
        std::string localAddress;
        int32_t localPort;
        int32_t remotePort;
        bool clientHoldsPortWithoutReuse;
    };
    const Case cases[] = {
        {"local port 0", kLoopback, 0, listenerPort, false},
        {"remote port 0", kLoopback, m_port, 0, false},
        {"local port 65536", kLoopback, 65536, listenerPort, false},
        {"remote port 65536", kLoopback, m_port, 65536, false},
        {"local address not a dotted quad", "localhost", m_port, listenerPort, false},
        // Linux shares a port only when every socket on it allows reuse.
        {"client socket without SO_REUSEADDR", kLoopback, m_port, listenerPort, true},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        std::optional<LoopbackSocket> client;
        if (c.clientHoldsPortWithoutReuse) {
            ASSERT_TRUE(client.emplace(static_cast<uint16_t>(c.localPort)).IsBound());
        }
        m_log.Clear();
        PortMapping mapping = MappingFrom(c.localPort, c.localAddress);
        mapping.m_remote.m_port = c.remotePort;
        mapping.Refresh();
        EXPECT_TRUE(m_log.Lines().empty());
        ExpectNextDatagramIsTheSentinel();
    }
}

TEST_F(RefreshTest, LogsAFailedSendAtError) {
    // Limited broadcast without SO_BROADCAST: the kernel refuses it (EACCES), nothing leaves.
    PortMapping mapping = MappingFrom(m_port);
    mapping.m_remote = {"255.255.255.255", 9};
    mapping.Refresh();

    const auto lines = m_log.LinesOf(kRefreshTag);
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].level, "ERROR");
    EXPECT_EQ(lines[0].message, "Failed(" + std::to_string(EACCES) + ") - " + mapping.ToString());
    // The failed socket was closed: the port binds without reuse.
    EXPECT_TRUE(LoopbackSocket(static_cast<uint16_t>(m_port)).IsBound());
}

TEST_F(RefreshTest, RefreshPortMappingsTracesAndRefreshesEveryElementInOrder) {
    RefreshPortMappings({});
    auto lines = m_log.Lines();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].level, "TRACE");
    EXPECT_EQ(lines[0].function, "CAdvancedPortManager::RefreshPortMappings");
    EXPECT_EQ(lines[0].message, "Entered...");

    m_log.Clear();
    const std::vector<PortMapping> list = {MappingFrom(m_port), MappingFrom(0),
                                           MappingFrom(m_port + 1)};
    RefreshPortMappings(list);
    for (const int32_t expectedPort : {m_port, m_port + 1}) {
        const auto datagram = m_listener.Receive();
        ASSERT_TRUE(datagram.has_value());
        EXPECT_EQ(datagram->fromPort, expectedPort);
    }
    lines = m_log.Lines();
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_EQ(lines[0].message, "Entered...");
    EXPECT_EQ(lines[1].message, "Succeeded - " + list[0].ToString());
    EXPECT_EQ(lines[2].message, "Succeeded - " + list[2].ToString());
}

TEST(DumpPortMappings, OneEntryWithTheFreeMappingsFrontToBack) {
    LogCapture log;
    testing::ScopedPool pool;
    DumpPortMappings("AudioRTP", pool);
    auto lines = log.LinesOf("DumpPortMappings");
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].level, "INFO");
    EXPECT_EQ(lines[0].message, "type=AudioRTP\n\n");

    const auto base = testing::FindFreeWindow(6);
    if (!base) {
        GTEST_SKIP() << "no free loopback ports";
    }
    ASSERT_TRUE(pool.Fill(false, 3, *base, *base + 6, kLoopback, "198.51.100.7", false));
    MappedServiceEndpoint handedOut;
    ASSERT_TRUE(pool.GetMapping(handedOut));  // in use: not shown
    log.Clear();
    DumpPortMappings("VideoRTCP", pool);
    lines = log.LinesOf("DumpPortMappings");
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].message, "type=VideoRTCP\n" + pool.Free()[0].ToString() + "\n" +
                                    pool.Free()[1].ToString() + "\n\n");
}

}  // namespace
}  // namespace portmanager
