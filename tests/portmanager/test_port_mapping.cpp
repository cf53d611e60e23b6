// Mapping records, their placeholder socket and the keep-alive, observed on loopback.
#include <gtest/gtest.h>

#include <cerrno>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/net.h"
#include "portmanager/PortMapping.h"
#include "portmanager/PortMappingPool.h"
#include "tests/portmanager/port_mapping_test_support.h"

namespace portmanager {
namespace {

// A datagram to the broadcast address without SO_BROADCAST: the system's "access denied".
#ifdef _WIN32
constexpr int kAccessDenied = 10013;  // WSAEACCES
#else
constexpr int kAccessDenied = EACCES;
#endif

using testing::IsHeld;
using testing::kLoopback;
using testing::LogCapture;
using testing::LoopbackSocket;

TEST(PortMappingText, RecordsReadAsTheLogShowsThem) {
    MappedServiceEndpoint withSocket({"10.1.2.3", 40000}, {"host.example", -1});
    withSocket.m_socket = 7;  // never shown
    const std::pair<PortMapping, const char*> cases[] = {
        {PortMapping(MappedServiceEndpoint({"192.0.2.10", 5062}, {"198.51.100.7", 5062}),
                     {"203.0.113.9", 5060}),
         "m_local=(m_private = (m_address= 192.0.2.10, m_port=5062), m_public=(m_address= "
         "198.51.100.7, m_port=5062)), m_remote=(m_address= 203.0.113.9, m_port=5060)"},
        {PortMapping(),
         "m_local=(m_private = (m_address= , m_port=0), m_public=(m_address= , "
         "m_port=0)), m_remote=(m_address= , m_port=0)"},
        {PortMapping(withSocket, {"sip.example.org", 65536}),
         "m_local=(m_private = (m_address= 10.1.2.3, m_port=40000), m_public=(m_address= "
         "host.example, m_port=-1)), m_remote=(m_address= sip.example.org, m_port=65536)"},
    };
    for (const auto& [mapping, text] : cases) {
        EXPECT_EQ(mapping.ToString(), text);
    }
}

// Open(false) on a given port is pinned by the pool's fills.
TEST(MappedServiceEndpoint, OpenOnAnyPortAndCopiesThatNeverClose) {
    const int before = platform::CountOpenDescriptors();
    MappedServiceEndpoint original({kLoopback, 0}, {"198.51.100.7", 0});
    EXPECT_EQ(original.m_socket, platform::kInvalidSocket);
    ASSERT_TRUE(original.Open(true));
    EXPECT_NE(original.m_private.m_port, 0);
    EXPECT_EQ(original.m_public, NetworkEndpoint("198.51.100.7", original.m_private.m_port));
    {
        const MappedServiceEndpoint copy = original;
        EXPECT_EQ(PortMapping(copy, {kLoopback, 5060}).m_local.m_socket, original.m_socket);
    }
    EXPECT_EQ(platform::CountOpenDescriptors(), before + 1);
    EXPECT_TRUE(IsHeld(original.m_private.m_port));
    original.Close();
    EXPECT_EQ(original.m_socket, platform::kInvalidSocket);
    EXPECT_EQ(platform::CountOpenDescriptors(), before);
    EXPECT_FALSE(IsHeld(original.m_private.m_port));
}

TEST(MappedServiceEndpoint, OpenFailsWithoutLeavingASocket) {
    const auto base = testing::FindFreeWindow(3);
    ASSERT_TRUE(base.has_value());
    // The placeholder sets no SO_REUSEADDR, so even a holder that allows reuse keeps it out.
    const LoopbackSocket plainHolder(static_cast<uint16_t>(*base));
    const LoopbackSocket reuseHolder(static_cast<uint16_t>(*base + 1), true);
    ASSERT_TRUE(plainHolder.IsBound() && reuseHolder.IsBound());
    const int32_t freePort = *base + 2;
    const std::pair<std::string, int32_t> cases[] = {
        {kLoopback, *base},      {kLoopback, *base + 1},
        {"localhost", freePort},                                 // not looked up
        {kLoopback, -1},         {kLoopback, freePort + 65536},  // must not wrap onto a free port
    };
    const int before = platform::CountOpenDescriptors();
    for (const auto& [address, port] : cases) {
        SCOPED_TRACE(address + ":" + std::to_string(port));
        MappedServiceEndpoint mapping({address, port}, {"198.51.100.7", 9});
        EXPECT_FALSE(mapping.Open(false));
        EXPECT_EQ(mapping.m_socket, platform::kInvalidSocket);
        EXPECT_EQ(mapping.m_private.m_port, port);
        EXPECT_EQ(mapping.m_public.m_port, 9);
        EXPECT_EQ(platform::CountOpenDescriptors(), before);
    }
    EXPECT_FALSE(IsHeld(freePort));
}

class RefreshTest : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_TRUE(m_listener.IsBound());
        const auto base = testing::FindFreeWindow(3);
        ASSERT_TRUE(base.has_value());
        m_port = *base;
    }

    PortMapping MappingFrom(int32_t port, std::string address = kLoopback) const {
        return PortMapping(
            MappedServiceEndpoint({std::move(address), port}, {"198.51.100.7", port}),
            {kLoopback, m_listener.Port()});
    }

    int32_t NextSender() {
        const auto datagram = m_listener.Receive();
        return datagram ? datagram->fromPort : -1;
    }

    LogCapture m_log;
    LoopbackSocket m_listener;
    int32_t m_port = 0;
};

TEST_F(RefreshTest, RefreshPortMappingsTracesAndRefreshesEveryElementInOrder) {
    std::vector<PortMapping> list = {MappingFrom(m_port), MappingFrom(0), MappingFrom(m_port + 1),
                                     MappingFrom(m_port + 2)};
    // Limited broadcast without SO_BROADCAST: the kernel refuses it with EACCES.
    list[3].m_remote = {"255.255.255.255", 9};
    const int before = platform::CountOpenDescriptors();  // every keep-alive socket is closed
    RefreshPortMappings({});
    RefreshPortMappings(list);
    EXPECT_EQ(NextSender(), m_port);
    EXPECT_EQ(NextSender(), m_port + 1);
    EXPECT_EQ(platform::CountOpenDescriptors(), before);
    const auto lines = m_log.Lines();
    ASSERT_EQ(lines.size(), 5u);
    for (const int i : {0, 1}) {
        EXPECT_EQ(lines[i].level, "TRACE");
        EXPECT_EQ(lines[i].function, "CAdvancedPortManager::RefreshPortMappings");
        EXPECT_EQ(lines[i].message, "Entered...");
    }
    EXPECT_EQ(m_log.LinesOf("PortMapping::Refresh").size(), 3u);
    EXPECT_EQ(lines[2].level, "DEBUG");
    EXPECT_EQ(lines[2].message, "Succeeded - " + list[0].ToString());
    EXPECT_EQ(lines[3].message, "Succeeded - " + list[2].ToString());
    EXPECT_EQ(lines[4].level, "ERROR");
    EXPECT_EQ(lines[4].message,
              "Failed(" + std::to_string(kAccessDenied) + ") - " + list[3].ToString());
}

TEST_F(RefreshTest, SkipsSilentlyWhatCannotBeSent) {
    const int32_t listener = m_listener.Port();
    // Last: a client holding the port without SO_REUSEADDR; Linux then shares it with no one.
    const std::pair<std::string, int32_t> cases[] = {
        {kLoopback, 0}, {kLoopback, 65536}, {"localhost", listener}, {kLoopback, listener}};
    std::optional<LoopbackSocket> client;
    for (const auto& [address, remotePort] : cases) {
        SCOPED_TRACE(address + " -> " + std::to_string(remotePort));
        if (remotePort == listener && address == kLoopback) {
            ASSERT_TRUE(client.emplace(static_cast<uint16_t>(m_port)).IsBound());
        }
        m_log.Clear();
        PortMapping mapping = MappingFrom(m_port, address);
        mapping.m_remote.m_port = remotePort;
        mapping.Refresh();
        EXPECT_TRUE(m_log.Lines().empty());
        // A keep-alive that must arrive: nothing came before it, without waiting for silence.
        MappingFrom(m_port + 2).Refresh();
        EXPECT_EQ(NextSender(), m_port + 2);
    }
}

TEST(DumpPortMappings, OneEntryWithTheFreeMappingsFrontToBack) {
    LogCapture log;
    testing::ScopedPool pool;
    DumpPortMappings("AudioRTP", pool);
    const auto base = testing::FindFreeWindow(6);
    ASSERT_TRUE(base.has_value());
    ASSERT_TRUE(pool.Fill(false, 3, *base, *base + 6, kLoopback, "198.51.100.7", false));
    MappedServiceEndpoint handedOut;
    ASSERT_TRUE(pool.GetMapping(handedOut));  // in use: not shown
    DumpPortMappings("VideoRTCP", pool);
    const auto lines = log.LinesOf("DumpPortMappings");
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_EQ(lines[0].level, "INFO");
    EXPECT_EQ(lines[0].message, "type=AudioRTP\n\n");
    EXPECT_EQ(lines[1].message, "type=VideoRTCP\n" + pool.Free()[0].ToString() + "\n" +
                                    pool.Free()[1].ToString() + "\n\n");
}

}  // namespace
}  // namespace portmanager
