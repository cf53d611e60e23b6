// Enabling a profile on the port manager, handing out and taking back mappings, and the
// keep-alives that leave from them, observed by real sockets on loopback.
#include <gtest/gtest.h>

#include <deque>
#include <memory>
#include <string>

#include "platform/message.h"
#include "platform/upnp.h"
#include "tests/portmanager/port_mapping_test_support.h"
#include "tests/support/FakeNetworkInfo.h"
#include "tests/support/PortManagerDoubles.h"

namespace {

using portmanager::testing::FindFreeWindow;
using portmanager::testing::LogCapture;
using portmanager::testing::LoopbackSocket;
using testsupport::PortManagerWithFakeStun;
using testsupport::RecordingSink;

constexpr uint32_t kLoopbackHost = 0x7F000001;
constexpr uint32_t kPublic = 0xC6336407;  // 198.51.100.7
const std::vector<uint8_t> kKeepAlive = {0x00, 0x01, 0x02, 0x03};

struct Mapping {
    HRESULT hr;
    std::string privateAddress;
    LONG privatePort;
    std::string publicAddress;
    LONG publicPort;
};

// A port manager whose discovery found a full cone NAT for 127.0.0.1 (public 198.51.100.7), with
// its SIP server on a loopback listener, so that its keep-alives can be watched.
class Profiles : public ::testing::Test {
  protected:
    void SetUp() override {
        net.AddInterface("127.0.0.1", "");
        const auto base = FindFreeWindow(24);
        ASSERT_TRUE(base.has_value()) << "no free window of loopback ports";
        minPort = *base;
        maxPort = *base + 20;
        sipPort = *base + 22;  // outside the pools
        const std::string sipServer = "127.0.0.1:" + std::to_string(sipServerSocket.Port());
        h.nextList.count = 1;
        h.nextList.entries[0] = {kLoopbackHost, stun::STUN_RESULT_FULL_CONE_NAT, kPublic};
        RecordingSink& sink = sinks.emplace_back();
        h.Connect(sink);
        ASSERT_EQ(h.Initialize(false, true, sipServer.c_str(), "media.example.net"), S_OK);
        ASSERT_TRUE(platform::RunMessageLoopUntil([&] { return !sink.received.empty(); }, 5000));
        ASSERT_EQ(h.pm->QueryInterface(IID_IPortMappingProvider, provider.GetVoidAddressOf()),
                  S_OK);
    }

    HRESULT Enable(std::vector<std::string> addresses, LONG perProtocol = 2,
                   VARIANT_BOOL randomize = VARIANT_FALSE) {
        VARIANT v;
        VariantInit(&v);
        v.vt = VT_ARRAY | VT_BSTR;
        v.parray = MakeBstrArray(addresses);
        const HRESULT hr =
            h.pm->OnBeforeEnableProfileEx(v, minPort, maxPort, perProtocol, randomize);
        VariantClear(&v);
        return hr;
    }
    HRESULT EnableSip() { return Enable({"127.0.0.1:" + std::to_string(sipPort)}); }

    Mapping Get(LONG type) {
        BStr priv;
        BStr pub;
        Mapping m{};
        BStr unused("");
        m.hr = provider->GetMapping(unused.Get(), type, priv.Out(), &m.privatePort, pub.Out(),
                                    &m.publicPort);
        m.privateAddress = priv.Utf8();
        m.publicAddress = pub.Utf8();
        return m;
    }
    HRESULT Release(const Mapping& m) {
        BStr priv(m.privateAddress);
        BStr pub(m.publicAddress);
        return provider->ReleaseMapping(priv.Get(), m.privatePort, pub.Get(), m.publicPort);
    }
    HRESULT Register(const Mapping& m, uint16_t remotePort) {
        BStr remote("127.0.0.1");
        BStr priv(m.privateAddress);
        BStr pub(m.publicAddress);
        return provider->UpdateRemoteAddressEx(remote.Get(), remotePort, priv.Get(), m.privatePort,
                                               pub.Get(), m.publicPort);
    }
    // The next keep-alive at the listener, checked to be the 4 bytes, from the given port. The
    // loop is pumped meanwhile: ticks of the keep-alive timer arrive through it.
    void ExpectKeepAlive(LoopbackSocket& listener, uint16_t fromPort) {
        std::optional<LoopbackSocket::Datagram> d;
        platform::RunMessageLoopUntil(
            [&] {
                if (!d) {
                    d = listener.Receive(0);  // the loop may ask more than once
                }
                return d.has_value();
            },
            2000);
        ASSERT_TRUE(d.has_value()) << "no keep-alive arrived";
        EXPECT_EQ(d->bytes, kKeepAlive);
        EXPECT_EQ(d->fromAddress, kLoopbackHost);
        EXPECT_EQ(d->fromPort, fromPort);
    }

    testsupport::FakeNetworkInfo net;
    std::deque<RecordingSink> sinks;
    LoopbackSocket sipServerSocket;
    PortManagerWithFakeStun h{testsupport::ServicesWith(net)};
    ComPtr<IPortMappingProvider> provider;
    LONG minPort = 0;
    LONG maxPort = 0;
    uint16_t sipPort = 0;
};

TEST_F(Profiles, EnableSendsAKeepAliveFromTheSipMappingWhichIsAlwaysTheSame) {
    ASSERT_EQ(EnableSip(), S_OK);
    ExpectKeepAlive(sipServerSocket, sipPort);
    const Mapping sip = Get(SIP);
    ASSERT_EQ(sip.hr, S_OK);
    EXPECT_EQ(sip.privateAddress, "127.0.0.1");
    EXPECT_EQ(sip.privatePort, sipPort);
    EXPECT_EQ(sip.publicAddress, "198.51.100.7");
    EXPECT_EQ(sip.publicPort, sipPort);
    // Always the same, and not released.
    LogCapture log;
    EXPECT_EQ(Release(sip), S_OK);
    EXPECT_EQ(Get(SIP).privatePort, sip.privatePort);
    bool logged = false;
    for (const auto& line : log.LinesOf("CAdvancedPortManager::ReleaseMapping")) {
        logged |=
            line.level == "ERROR" && line.message.rfind("MappedServiceEndpoint is SIP - ", 0) == 0;
    }
    EXPECT_TRUE(logged);
}

TEST_F(Profiles, OnlyAddressesEqualToThePrivateOneBecomeSipMappings) {
    LogCapture log;
    ASSERT_EQ(Enable({"192.0.2.99:5062", "127.0.0.1", "127.0.0.1:" + std::to_string(sipPort)}),
              S_OK);
    int added = 0;
    for (const auto& line : log.LinesOf("CAdvancedPortManager::OnBeforeEnableProfileEx")) {
        added += line.message.rfind("Adding SIP Port Mapping for ", 0) == 0 ? 1 : 0;
    }
    EXPECT_EQ(added, 2);
    // The first matching address has no port: its mapping is handed out with port 0.
    const Mapping sip = Get(SIP);
    EXPECT_EQ(sip.privatePort, 0);
    EXPECT_EQ(Get(SIP).privatePort, 0);
}

TEST_F(Profiles, EnablePreconditions) {
    VARIANT wrong;
    VariantInit(&wrong);
    wrong.vt = VT_BSTR;
    wrong.bstrVal = SysAllocString(OLESTR("127.0.0.1"));
    EXPECT_EQ(h.pm->OnBeforeEnableProfileEx(wrong, minPort, maxPort, 2, VARIANT_FALSE),
              E_INVALIDARG);
    VariantClear(&wrong);
    EXPECT_EQ(Enable({}), E_FAIL);                   // no address at all
    EXPECT_EQ(Enable({"192.0.2.99:5060"}), E_FAIL);  // none equal to the private address
    const int descriptors = platform::CountOpenDescriptors();
    EXPECT_EQ(Enable({"127.0.0.1"}, -1), E_INVALIDARG);  // before any port is bound
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
    ASSERT_EQ(EnableSip(), S_OK);
    EXPECT_EQ(EnableSip(), E_FAIL);  // already enabled
    EXPECT_EQ(h.pm->OnBeforeDisableProfile(), S_OK);
    EXPECT_EQ(EnableSip(), S_OK);
}

TEST_F(Profiles, ZeroElementSizeIsLoggedAsAFailedAssertion) {
    LogCapture log;
    VARIANT v;
    VariantInit(&v);
    v.vt = VT_ARRAY | VT_BSTR;
    v.parray = MakeBstrArray({"127.0.0.1"});
    const ULONG size = v.parray->cbElements;
    v.parray->cbElements = 0;
    EXPECT_EQ(h.pm->OnBeforeEnableProfileEx(v, minPort, maxPort, 2, VARIANT_FALSE), E_FAIL);
    v.parray->cbElements = size;
    VariantClear(&v);
    bool logged = false;
    for (const auto& line : log.LinesOf("CAdvancedPortManager::OnBeforeEnableProfileEx")) {
        logged |= line.level == "ERROR" &&
                  line.message.find("Failed Assertion - networkAddresses.vt") == 0;
    }
    EXPECT_TRUE(logged);
}

TEST_F(Profiles, RangeTooSmallFailsAndTheClientMayRetry) {
    maxPort = minPort + 4;  // room for two even ports: the spare pool takes both
    EXPECT_EQ(EnableSip(), E_FAIL);
    maxPort = minPort + 20;
    EXPECT_EQ(EnableSip(), S_OK);
}

TEST_F(Profiles, MediaMappingsComeFromTheirPoolsAndReleasedPortsComeBackFirst) {
    ASSERT_EQ(EnableSip(), S_OK);
    const Mapping first = Get(AudioRTP);
    const Mapping second = Get(AudioRTP);
    ASSERT_EQ(first.hr, S_OK);
    ASSERT_EQ(second.hr, S_OK);
    EXPECT_NE(first.privatePort, second.privatePort);
    EXPECT_EQ(first.privatePort % 2, 0);
    EXPECT_EQ(second.privatePort % 2, 0);
    EXPECT_GE(first.privatePort, minPort);
    EXPECT_LT(first.privatePort, maxPort);
    EXPECT_EQ(first.publicAddress, "198.51.100.7");
    EXPECT_EQ(first.publicPort, first.privatePort);
    EXPECT_EQ(Get(AudioRTCP).privatePort % 2, 1);
    // The port handed out is free for the client to bind.
    LoopbackSocket client(static_cast<uint16_t>(first.privatePort));
    EXPECT_TRUE(client.IsBound());
    client.Close();
    // Not registered for keep-alives: back to its pool, but not found in the media list.
    EXPECT_EQ(Release(first), E_FAIL);
    EXPECT_EQ(Get(AudioRTP).privatePort, first.privatePort);
    // Both handed out: the pool is empty now.
    EXPECT_EQ(Get(AudioRTP).hr, E_FAIL);
}

TEST_F(Profiles, UnknownTypeWritesNothingAndBadCallsFail) {
    ASSERT_EQ(EnableSip(), S_OK);
    BSTR priv = nullptr;
    LONG port = -7;
    BSTR pub = nullptr;
    LONG pubPort = -8;
    BStr unused("");
    EXPECT_EQ(provider->GetMapping(unused.Get(), 7, &priv, &port, &pub, &pubPort), S_OK);
    EXPECT_EQ(priv, nullptr);
    EXPECT_EQ(port, -7);
    EXPECT_EQ(pub, nullptr);
    EXPECT_EQ(pubPort, -8);
    EXPECT_EQ(provider->GetMapping(unused.Get(), AudioRTP, nullptr, &port, &pub, &pubPort),
              E_POINTER);
    // Releasing a mapping nobody handed out logs both misses.
    LogCapture log;
    EXPECT_EQ(Release({S_OK, "127.0.0.1", 1, "198.51.100.7", 1}), E_FAIL);
    std::vector<std::string> errors;
    for (const auto& line : log.LinesOf("CAdvancedPortManager::ReleaseMapping")) {
        if (line.level == "ERROR") {
            errors.push_back(line.message.substr(0, line.message.find(" - ")));
        }
    }
    EXPECT_EQ(errors, (std::vector<std::string>{"MappedServiceEndpoint not found in mapping pool",
                                                "MappedServiceEndpoint not found in media pool"}));
}

TEST_F(Profiles, RegisteredMediaMappingIsRefreshedUntilReleased) {
    ASSERT_EQ(EnableSip(), S_OK);
    ExpectKeepAlive(sipServerSocket, sipPort);
    const Mapping media = Get(AudioRTP);
    // The client binds its media port the way a Linux client must for keep-alives to share it.
    LoopbackSocket client(static_cast<uint16_t>(media.privatePort), true);
    ASSERT_TRUE(client.IsBound());
    LoopbackSocket remote;
    ASSERT_EQ(Register(media, remote.Port()), S_OK);
    ExpectKeepAlive(remote, static_cast<uint16_t>(media.privatePort));  // at once
    // While the profile is enabled a full tick follows 200 ms later: SIP and media alike.
    ExpectKeepAlive(remote, static_cast<uint16_t>(media.privatePort));
    ExpectKeepAlive(sipServerSocket, sipPort);

    EXPECT_EQ(Release(media), S_OK);
    EXPECT_EQ(Release(media), E_FAIL);  // gone from the media list
    // Registering another mapping triggers a tick: only the new one and SIP are refreshed now.
    const Mapping other = Get(AudioRTCP);
    LoopbackSocket otherRemote;
    ASSERT_EQ(Register(other, otherRemote.Port()), S_OK);
    ExpectKeepAlive(otherRemote, static_cast<uint16_t>(other.privatePort));
    ExpectKeepAlive(otherRemote, static_cast<uint16_t>(other.privatePort));
    ExpectKeepAlive(sipServerSocket, sipPort);
    EXPECT_FALSE(remote.Receive(300).has_value());
}

TEST_F(Profiles, WithoutAProfileARegisteredMappingSendsOnceAndArmsNoTimer) {
    LoopbackSocket remote;
    const Mapping m{S_OK, "127.0.0.1", static_cast<LONG>(sipPort), "198.51.100.7",
                    static_cast<LONG>(sipPort)};
    ASSERT_EQ(Register(m, remote.Port()), S_OK);
    ExpectKeepAlive(remote, sipPort);
    platform::RunMessageLoopUntil([] { return false; }, 400);
    EXPECT_FALSE(remote.Receive(0).has_value());
}

TEST_F(Profiles, RegisteringTwiceGivesTwoKeepAlivesPerTickAndOneReleaseRemovesOne) {
    ASSERT_EQ(EnableSip(), S_OK);
    ExpectKeepAlive(sipServerSocket, sipPort);
    const Mapping media = Get(VideoRTP);
    LoopbackSocket remote;
    ASSERT_EQ(Register(media, remote.Port()), S_OK);
    ASSERT_EQ(Register(media, remote.Port()), S_OK);
    for (int i = 0; i < 4; ++i) {  // two at once, two on the early tick
        ExpectKeepAlive(remote, static_cast<uint16_t>(media.privatePort));
    }
    EXPECT_EQ(Release(media), S_OK);
    EXPECT_EQ(Release(media), S_OK);  // the second registration was still there
    EXPECT_EQ(Release(media), E_FAIL);
}

TEST_F(Profiles, GetMappingAfterShutdownFails) {
    ASSERT_EQ(EnableSip(), S_OK);
    h.pm->Shutdown();
    LogCapture log;
    EXPECT_EQ(Get(AudioRTP).hr, E_FAIL);
    ASSERT_FALSE(log.LinesOf("CAdvancedPortManager::GetMapping").empty());
}

}  // namespace
