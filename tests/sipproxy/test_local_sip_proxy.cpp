// The local SIP proxy between loopback sockets and the port manager it starts with; sipp and
// Kamailio through it are the lab test's.
#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <mutex>
#include <string>

#include "platform/kernel.h"
#include "tests/sipproxy/proxy_test_support.h"
#include "tests/support/DnsLab.h"
#include "tests/support/LogCapture.h"

namespace {

using sipproxy::testing::CountThreads;
using sipproxy::testing::LoopbackSocket;
using sipproxy::testing::ProxyFixture;
using sipproxy::testing::Text;

using Proxy = ProxyFixture;

TEST_F(Proxy, SenderEndpointFollowsTheInternalSocketButNotWhileRunning) {
    EXPECT_EQ(SenderEndpoint(), ":0");
    EXPECT_EQ(proxy->put_InternalAddress(nullptr), E_POINTER);
    ASSERT_EQ(SetInternal(), S_OK);
    const std::string first = SenderEndpoint();
    ASSERT_EQ(first.rfind("127.0.0.1:", 0), 0u) << first;
    const int port = std::stoi(first.substr(10));
    EXPECT_TRUE(port >= 10000 && port <= 60000) << first;  // from the rotating sequence
    const int descriptors = platform::CountOpenDescriptors();
    ASSERT_EQ(SetInternal(), S_OK);
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors) << "the old socket stays open";
    EXPECT_NE(SenderEndpoint(), first);
    BStr internal;
    EXPECT_EQ(proxy->get_InternalAddress(internal.Out()), S_OK);
    EXPECT_EQ(internal.Utf8(), "127.0.0.1");
    // It cannot move while running.
    ASSERT_EQ(StartProxy(), S_OK);
    const std::string running = SenderEndpoint();
    EXPECT_EQ(SetInternal(), E_FAIL);
    EXPECT_EQ(SenderEndpoint(), running);
    LoopbackSocket client;
    ExpectRegisterRelayed(client, "z9hG4bK1");
}

TEST_F(Proxy, RelaysBothWaysAndRewrites) {
    ASSERT_EQ(StartProxy(), S_OK);
    LoopbackSocket client;
    ExpectRegisterRelayed(client, "z9hG4bK1");
    EXPECT_NE(externalPort, InternalPort());
    // A request of the server reaches the learned client with the proxy as the server.
    const std::string contact = std::string("127.0.0.2:") + std::to_string(externalPort);
    const std::string serverEndpoint = "127.0.0.1:" + std::to_string(server.Port());
    SendTo(server,
           "OPTIONS sip:alice@" + contact + " SIP/2.0\r\nVia: SIP/2.0/UDP " + serverEndpoint +
               ";branch=z9hG4bK2\r\n\r\n",
           externalPort);
    const auto options = client.Receive();
    ASSERT_TRUE(options.has_value());
    EXPECT_EQ(Text(*options), "OPTIONS sip:alice@127.0.0.1:" + std::to_string(client.Port()) +
                                  " SIP/2.0\r\nVia: SIP/2.0/UDP " + SenderEndpoint() +
                                  ";branch=z9hG4bK2\r\n\r\n");
    ASSERT_EQ(proxy->Stop(), S_OK);  // the threads count after they sent
    const auto counts = static_cast<sipproxy::CLocalSipProxy*>(proxy)->Counts();
    EXPECT_EQ(counts.toServer, 1u);
    EXPECT_EQ(counts.toClient, 2u);
}

TEST_F(Proxy, ForgedStopEmptyAndOversizedDatagramsAreDroppedAndRelayingGoesOn) {
    ASSERT_EQ(StartProxy(), S_OK);
    LoopbackSocket client;
    ExpectRegisterRelayed(client, "z9hG4bK1");
    testsupport::LogCapture log;  // the logger at every level
    std::mutex mutex;
    std::vector<std::string> lines;  // raw, since the relay trace is no log line
    platform::SetDebugOutputSink([&](std::string_view line) {
        std::lock_guard<std::mutex> lock(mutex);
        lines.emplace_back(line);
    });
    SendTo(server, "STOP", externalPort);
    SendTo(server, "", externalPort);
    SendTo(server, std::string(5000, 'x'), externalPort);
    LoopbackSocket other;
    SendTo(other, "STOP", InternalPort());
    SendTo(client, "", InternalPort());
    ExpectRegisterRelayed(client, "z9hG4bK3");
    platform::SetDebugOutputSink(nullptr);
    int dropped = 0;
    for (const std::string& line : lines) {
        dropped += line.find("ServiceProc Dropped ") != std::string::npos ? 1 : 0;
        EXPECT_EQ(line.find("Exited(..."), std::string::npos) << line;
    }
    EXPECT_EQ(dropped, 5);
    ASSERT_EQ(proxy->Stop(), S_OK);
    EXPECT_EQ(static_cast<sipproxy::CLocalSipProxy*>(proxy)->Counts().dropped, 5u);
}

TEST_F(Proxy, StopIsPromptIdempotentAndStartWorksAgainUntilReleaseFreesEverything) {
    const int threads = CountThreads();
    EXPECT_EQ(proxy->Stop(), S_OK);  // before any Start
    ASSERT_EQ(StartProxy(), S_OK);
    EXPECT_EQ(CountThreads(), threads + 2);
    EXPECT_EQ(proxy->Start(h.pm.Get(), 0, 0, VARIANT_FALSE), S_OK);  // running: nothing more
    EXPECT_EQ(CountThreads(), threads + 2);
    auto client = std::make_unique<LoopbackSocket>();
    ExpectRegisterRelayed(*client, "z9hG4bK1");
    const auto before = std::chrono::steady_clock::now();
    EXPECT_EQ(proxy->Stop(), S_OK);
    EXPECT_LT(std::chrono::steady_clock::now() - before, std::chrono::milliseconds(500));
    EXPECT_EQ(CountThreads(), threads);
    EXPECT_EQ(SenderEndpoint(), ":0");
    EXPECT_EQ(proxy->Stop(), S_OK);
    ASSERT_EQ(StartProxy(), S_OK);
    ExpectRegisterRelayed(*client, "z9hG4bK2");
    client.reset();
    // Released while running: the final release stops it.
    proxy->Release();
    proxy = nullptr;
    EXPECT_EQ(CountThreads(), threads);
}

class ProxyWithPortlessServer : public ProxyFixture {
  protected:
    void SetUp() override {
        SetUpPortManager("127.0.0.1");
        ASSERT_EQ(sipproxy::CLocalSipProxy::CreateInstance(IID_ILocalSipProxy,
                                                           reinterpret_cast<void**>(&proxy)),
                  S_OK);
    }
};

TEST_F(ProxyWithPortlessServer, ServerWithoutPortIsTakenOn5060) {
    ASSERT_EQ(StartProxy(), S_OK);
    auto* relay = static_cast<sipproxy::CLocalSipProxy*>(proxy);
    EXPECT_EQ(relay->ServerEndpoint(), "127.0.0.1:5060");
    // The mapping's public address with the external socket's own port.
    const std::string contact = relay->PublicContact();
    ASSERT_EQ(contact.rfind("127.0.0.2:", 0), 0u) << contact;
    EXPECT_NE(contact.substr(10), std::to_string(sipMappingPort));
    EXPECT_NE(contact.substr(10), std::to_string(InternalPort()));
}

// One wait of the full period: the keep-alive is exactly "CONT" from the external socket.
TEST_F(Proxy, KeepAliveReachesTheServerEveryThirtySeconds) {
    ASSERT_EQ(StartProxy(), S_OK);
    LoopbackSocket client;
    ExpectRegisterRelayed(client, "z9hG4bK1");
    std::optional<LoopbackSocket::Datagram> keepAlive;
    const auto start = std::chrono::steady_clock::now();
    platform::RunMessageLoopUntil(
        [&] {
            if (!keepAlive) {
                keepAlive = server.Receive(0);
                if (keepAlive && keepAlive->fromPort != externalPort) {
                    keepAlive.reset();  // the port manager's own keep-alive
                }
            }
            return keepAlive.has_value();
        },
        35000);
    ASSERT_TRUE(keepAlive.has_value());
    EXPECT_EQ(Text(*keepAlive), "CONT");
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::seconds(29));
}

}  // namespace

namespace {

// The look-up against a name server of the test's own: the outer test builds the lab and runs
// itself inside it, where the body does the checking.
class LabProxyDns : public ProxyFixture {
  protected:
    void SetUp() override {}
};

TEST_F(LabProxyDns, UnresolvableServerGivesEFailAndStartsNoThread) {
    NQPM_RUN_INSIDE_DNS_LAB("LabProxyDns.UnresolvableServerGivesEFailAndStartsNoThread")
    SetUpPortManager(std::string(testsupport::DnsLab::kUnknownName) + ":5070");
    ASSERT_EQ(sipproxy::CLocalSipProxy::CreateInstance(IID_ILocalSipProxy,
                                                       reinterpret_cast<void**>(&proxy)),
              S_OK);
    const int threads = CountThreads();
    EXPECT_EQ(StartProxy(), E_FAIL);
    EXPECT_EQ(CountThreads(), threads);
    EXPECT_EQ(proxy->Stop(), S_OK);
}

}  // namespace
