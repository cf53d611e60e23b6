#include <gtest/gtest.h>

#include <algorithm>
#include <deque>
#include <memory>
#include <string>

#include "foundation/Logger.h"
#include "platform/message.h"
#include "platform/upnp.h"
#include "portmanager/AdvancedPortManager.h"
#include "portmanager/PortManagerUpdateEvent.h"
#include "tests/support/FakeNetworkInfo.h"
#include "tests/support/LogCapture.h"
#include "tests/support/PortManagerDoubles.h"

namespace {

using testsupport::PortManagerWithFakeStun;
using testsupport::RecordingSink;
using testsupport::ToUtf8;

constexpr uint32_t A = 0xC000020A;  // 192.0.2.10
constexpr uint32_t B = 0xC000020B;  // 192.0.2.11
constexpr uint32_t P = 0xC6336407;  // 198.51.100.7
constexpr uint32_t Q = 0xCB007109;  // 203.0.113.9

struct FixedUpnpProbe : platform::UpnpGatewayProbe {
    bool GatewayPresent() override { return present; }
    bool present = false;  // set before the port manager starts a search
};

// Each test: a port manager with a fake STUN service, a fake network listing 192.0.2.10, and no
// real UPnP search.
class PortManager : public ::testing::Test {
  protected:
    PortManager() { net.AddInterface("192.0.2.10", "192.0.2.1"); }

    void PumpUntilEvents(RecordingSink& sink, size_t count) {
        ASSERT_TRUE(
            platform::RunMessageLoopUntil([&] { return sink.received.size() >= count; }, 5000));
    }
    std::string Text(HRESULT (IAdvancedPortManager::*getter)(BSTR*)) {
        BSTR s = nullptr;
        EXPECT_EQ((H().pm.Get()->*getter)(&s), S_OK);
        return ToUtf8(s);
    }
    std::string Private() { return Text(&IAdvancedPortManager::get_PrivateIpAddress); }
    std::string Public() { return Text(&IAdvancedPortManager::get_PublicIpAddress); }
    std::string SipServer() { return Text(&IAdvancedPortManager::get_RecommendedSipServer); }
    std::string Suffix() { return Text(&IAdvancedPortManager::get_ClientNameSuffix); }
    PM_STATE State() {
        PM_STATE s{};
        EXPECT_EQ(H().pm->get_State(&s), S_OK);
        return s;
    }
    PM_TOPOLOGY Topology() {
        PM_TOPOLOGY t{};
        EXPECT_EQ(H().pm->get_Topology(&t), S_OK);
        return t;
    }
    // Null, or the port manager itself (checked), with the reference released.
    bool PortManagerRecommended() {
        IUnknown* unk = nullptr;
        EXPECT_EQ(H().pm->get_RecommendedPortManager(&unk), S_OK);
        if (unk == nullptr) {
            return false;
        }
        EXPECT_EQ(unk, static_cast<IUnknown*>(H().pm.Get()));
        unk->Release();
        return true;
    }

    // Sinks outlive the port manager, which releases them at its end.
    RecordingSink& NewSink() { return sinks.emplace_back(); }
    // A fresh port manager (the previous one is released).
    PortManagerWithFakeStun& H() { return *holder; }
    void Renew() { holder = std::make_unique<PortManagerWithFakeStun>(Services()); }
    portmanager::PortManagerServices Services() { return testsupport::ServicesWith(net, &upnp); }

    testsupport::FakeNetworkInfo net;
    FixedUpnpProbe upnp;
    std::deque<RecordingSink> sinks;
    std::unique_ptr<PortManagerWithFakeStun> holder =
        std::make_unique<PortManagerWithFakeStun>(Services());
};

HRESULT Init(IAdvancedPortManager* pm, BSTR stun, LONG start, LONG count, BSTR sip, BSTR media,
             LONG refresh = 30000) {
    return pm->InitializeEx2(stun, start, count, sip, media, VARIANT_TRUE, VARIANT_TRUE, refresh,
                             VARIANT_TRUE, VARIANT_TRUE, VARIANT_TRUE);
}

TEST_F(PortManager, DefaultsBeforeInitializationAndShutdownKeepsTheState) {
    BStr stale(OLESTR("x"));
    BSTR server = stale.Get();
    ASSERT_EQ(H().pm->get_StunServer(&server), S_OK);
    EXPECT_EQ(server, nullptr);
    LONG value = 0;
    H().pm->get_StartingPort(&value);
    EXPECT_EQ(value, 5004);
    H().pm->get_NumberOfPorts(&value);
    EXPECT_EQ(value, 16);
    EXPECT_EQ(State(), PMS_UNINITIALIZED);
    EXPECT_EQ(Topology(), PMT_UNKNOWN);
    EXPECT_FALSE(PortManagerRecommended());
    EXPECT_EQ(SipServer(), "");
    VARIANT_BOOL upnpEnabled = VARIANT_TRUE;
    H().pm->get_RecommendedUpnpEnabled(&upnpEnabled);
    EXPECT_EQ(upnpEnabled, VARIANT_FALSE);
    EXPECT_EQ(Suffix() + Private() + Public(), "");
    EXPECT_EQ(H().pm->get_State(nullptr), E_POINTER);
    EXPECT_EQ(H().pm->get_StunServer(nullptr), E_POINTER);
    EXPECT_EQ(H().pm->get_RecommendedPortManager(nullptr), E_POINTER);
    EXPECT_EQ(H().pm->Refresh(), E_FAIL);
    EXPECT_EQ(State(), PMS_UNINITIALIZED);
    ASSERT_EQ(H().Initialize(false, false), S_OK);
    EXPECT_EQ(H().pm->Shutdown(), S_OK);
    EXPECT_EQ(H().pm->Shutdown(), S_OK);
    EXPECT_EQ(State(), PMS_COMPLETED);
    EXPECT_EQ(H().Initialize(false, false), E_FAIL);  // initialised at most once
}

TEST_F(PortManager, InitializeChecksRunInOrderAndChangeNothingOnFailure) {
    BStr stun("stun.example.net");
    BStr sip("sip");
    BStr media("media");
    IAdvancedPortManager* pm = H().pm.Get();
    // A null server name wins over bad ports.
    EXPECT_EQ(Init(pm, nullptr, 1, 5000, sip.Get(), media.Get()), E_POINTER);
    EXPECT_EQ(Init(pm, stun.Get(), 1023, 16, sip.Get(), media.Get()), E_INVALIDARG);
    EXPECT_EQ(Init(pm, stun.Get(), 65535, 0, sip.Get(), media.Get()), E_INVALIDARG);
    EXPECT_EQ(Init(pm, stun.Get(), 64511, 1024, sip.Get(), media.Get()), E_INVALIDARG);
    EXPECT_EQ(Init(pm, stun.Get(), 2000, 1025, sip.Get(), media.Get()), E_INVALIDARG);
    // On a new object a null proxy is E_POINTER; a short refresh interval E_INVALIDARG.
    EXPECT_EQ(Init(pm, stun.Get(), 5004, 16, nullptr, media.Get()), E_POINTER);
    EXPECT_EQ(Init(pm, stun.Get(), 5004, 16, sip.Get(), nullptr), E_POINTER);
    EXPECT_EQ(Init(pm, stun.Get(), 5004, 16, sip.Get(), media.Get(), 29999), E_INVALIDARG);
    EXPECT_EQ(State(), PMS_UNINITIALIZED);
    LONG value = 0;
    pm->get_StartingPort(&value);
    EXPECT_EQ(value, 5004);

    // The boundary values that pass: sum 65534, no lower bound on the count.
    ASSERT_EQ(Init(pm, stun.Get(), 64510, 1024, sip.Get(), media.Get(), 30000), S_OK);
    pm->get_StartingPort(&value);
    EXPECT_EQ(value, 64510);
    pm->get_NumberOfPorts(&value);
    EXPECT_EQ(value, 1024);
    BSTR server = nullptr;
    pm->get_StunServer(&server);
    EXPECT_EQ(ToUtf8(server), "stun.example.net");

    // Initialised: ports are still checked first, then the state, and only then the proxies.
    EXPECT_EQ(Init(pm, stun.Get(), 1023, 16, sip.Get(), media.Get()), E_INVALIDARG);
    EXPECT_EQ(Init(pm, stun.Get(), 5004, 16, sip.Get(), media.Get()), E_FAIL);
    EXPECT_EQ(Init(pm, stun.Get(), 5004, 16, nullptr, media.Get()), E_FAIL);

    // A count of zero or below and an empty server are accepted; InitializeEx as well.
    BStr empty("");
    for (LONG count : {0, -5}) {
        PortManagerWithFakeStun other(Services());
        EXPECT_EQ(Init(other.pm.Get(), empty.Get(), 1024, count, sip.Get(), media.Get()), S_OK);
    }
    PortManagerWithFakeStun other(Services());
    for (HRESULT expected : {S_OK, E_FAIL}) {
        EXPECT_EQ(other.pm->InitializeEx(empty.Get(), 5004, 16, sip.Get(), media.Get(),
                                         VARIANT_TRUE, VARIANT_TRUE),
                  expected);
    }
}

TEST_F(PortManager, BothDiscoveriesDisabledCompleteInsideInitialize) {
    RecordingSink& sink = NewSink();
    H().Connect(sink);
    ASSERT_EQ(H().Initialize(false, false), S_OK);
    ASSERT_EQ(sink.received.size(), 1u);  // fired before InitializeEx2 returned
    EXPECT_EQ(sink.received[0].type, PME_UPDATED);
    EXPECT_EQ(sink.received[0].state, PMS_COMPLETED);
    EXPECT_EQ(State(), PMS_COMPLETED);
    EXPECT_EQ(Private(), "192.0.2.10");  // the monitor's address reached the fall-back
    EXPECT_TRUE(PortManagerRecommended());
}

TEST_F(PortManager, ErrorCanBeDiagnosedBoundaries) {
    struct Case {
        uint32_t code;
        VARIANT_BOOL expected;
    };
    const Case cases[] = {{0x80EE000C, VARIANT_TRUE},  {0x80EF01F5, VARIANT_TRUE},
                          {0x80EF02BB, VARIANT_TRUE},  {0x80EF01F4, VARIANT_FALSE},
                          {0x80EF02BC, VARIANT_FALSE}, {0x80EE000B, VARIANT_FALSE},
                          {0, VARIANT_FALSE},          {0xFFFFFFFF, VARIANT_FALSE}};
    for (const auto& c : cases) {
        VARIANT_BOOL result = 7;
        EXPECT_EQ(H().pm->ErrorCanBeDiagnosed(static_cast<LONG>(c.code), &result), S_OK);
        EXPECT_EQ(result, c.expected) << std::hex << c.code;
    }
    EXPECT_EQ(H().pm->ErrorCanBeDiagnosed(0, nullptr), E_POINTER);
}

TEST_F(PortManager, UdpPacketsInPassesTheHostCounterOrItsError) {
    LONG count = 0;
    ASSERT_EQ(H().pm->get_UDPPacketsIn(&count), S_OK);
    EXPECT_EQ(count, 42);
    net.udpError = 2;
    count = 9;
    EXPECT_EQ(static_cast<uint32_t>(H().pm->get_UDPPacketsIn(&count)), 0x80070002u);
    EXPECT_EQ(count, 9);
    EXPECT_EQ(H().pm->get_UDPPacketsIn(nullptr), E_POINTER);
}

// The decision itself is tested as a table (test_discovery_decision.cpp); here what the client
// reads after a STUN pass reaches the window.
TEST_F(PortManager, NoUpnpGatewayGoesOnToStunAndTheClientReadsItsOutcome) {
    H().nextList.count = 2;
    H().nextList.entries[0] = {A, stun::STUN_RESULT_SYMMETRIC_NAT, stun::kNoPublicAddress};
    H().nextList.entries[1] = {B, stun::STUN_RESULT_FULL_CONE_NAT, Q};
    RecordingSink& sink = NewSink();
    H().Connect(sink);
    ASSERT_EQ(H().Initialize(true, true), S_OK);
    EXPECT_EQ(State(), PMS_INITIALIZING);
    PumpUntilEvents(sink, 1);
    EXPECT_EQ(sink.received.size(), 1u);
    EXPECT_EQ(H().stun->refreshes, 1);
    EXPECT_EQ(State(), PMS_COMPLETED);
    EXPECT_EQ(Topology(), PMT_STUN_FULL_CONE_NAT);
    EXPECT_EQ(Private(), "192.0.2.11");
    EXPECT_EQ(Public(), "203.0.113.9");
    EXPECT_EQ(SipServer(), "sip.example.net");
    EXPECT_EQ(Suffix(), "STUN");
    EXPECT_TRUE(PortManagerRecommended());
}

TEST_F(PortManager, StunValueOutsideTheResultsIsLoggedAndFallsBack) {
    testsupport::LogCapture log;
    H().nextList.count = 1;
    H().nextList.entries[0] = {B, 9, P};
    RecordingSink& sink = NewSink();
    H().Connect(sink);
    ASSERT_EQ(H().Initialize(false, true), S_OK);
    PumpUntilEvents(sink, 1);
    EXPECT_EQ(Topology(), PMT_UNKNOWN);
    EXPECT_EQ(SipServer(), "media.example.net");
    bool logged = false;
    for (const auto& line : log.LinesOf("CAdvancedPortManager::OnStunRefresh")) {
        logged |= line.level == "ERROR" && line.message == "pResult->stunResult = 0x9";
    }
    EXPECT_TRUE(logged);
}

TEST_F(PortManager, RefreshClearsTheRecommendationButKeepsTheAddresses) {
    H().nextList.count = 1;
    H().nextList.entries[0] = {A, stun::STUN_RESULT_FULL_CONE_NAT, P};
    RecordingSink& sink = NewSink();
    H().Connect(sink);
    ASSERT_EQ(H().Initialize(false, true), S_OK);
    PumpUntilEvents(sink, 1);
    H().stun->postOnRefresh = false;  // the next pass does not end
    ASSERT_EQ(H().pm->Refresh(), S_OK);
    EXPECT_EQ(State(), PMS_INITIALIZING);
    EXPECT_EQ(Topology(), PMT_UNKNOWN);
    EXPECT_FALSE(PortManagerRecommended());
    EXPECT_EQ(SipServer(), "");
    EXPECT_EQ(Suffix(), "");
    EXPECT_EQ(Private(), "192.0.2.10");
    EXPECT_EQ(Public(), "198.51.100.7");
}

TEST_F(PortManager, StaleOrUnreadyResultMessagesAreIgnored) {
    H().nextReady = false;
    RecordingSink& sink = NewSink();
    H().Connect(sink);
    ASSERT_EQ(H().Initialize(false, true), S_OK);
    platform::RunMessageLoopUntil([] { return false; }, 100);
    EXPECT_TRUE(sink.received.empty());
    EXPECT_EQ(State(), PMS_INITIALIZING);
}

TEST_F(PortManager, RefreshAfterShutdownFallsBackInsteadOfUsingTheGoneService) {
    RecordingSink& sink = NewSink();
    H().Connect(sink);
    ASSERT_EQ(H().Initialize(false, true), S_OK);
    PumpUntilEvents(sink, 1);
    H().pm->Shutdown();
    ASSERT_EQ(H().pm->Refresh(), S_OK);
    ASSERT_EQ(sink.received.size(), 2u);
    EXPECT_EQ(State(), PMS_COMPLETED);
    EXPECT_EQ(SipServer(), "media.example.net");
}

TEST_F(PortManager, UpnpGatewayRecommendsTheSipProxy) {
    upnp.present = true;
    RecordingSink& sink = NewSink();
    H().Connect(sink);
    ASSERT_EQ(H().Initialize(true, true), S_OK);
    EXPECT_EQ(State(), PMS_INITIALIZING);
    PumpUntilEvents(sink, 1);
    EXPECT_EQ(Topology(), PMT_UPNP_ENABLED_NAT_OR_FIREWALL);
    EXPECT_EQ(State(), PMS_COMPLETED);
    EXPECT_EQ(SipServer(), "sip.example.net");
    VARIANT_BOOL enabled = VARIANT_FALSE;
    H().pm->get_RecommendedUpnpEnabled(&enabled);
    EXPECT_EQ(enabled, VARIANT_TRUE);
    // No address was ever learnt, so no port manager is recommended.
    EXPECT_FALSE(PortManagerRecommended());
    EXPECT_EQ(H().stun->refreshes, 0);
}

TEST_F(PortManager, EventsReachEverySinkInConnectionOrderSkippingOneThatNoLongerAnswers) {
    std::vector<RecordingSink*> order;
    RecordingSink& first = NewSink();
    RecordingSink& mute = NewSink();
    RecordingSink& second = NewSink();
    first.order = &order;
    second.order = &order;
    mute.answerEventQueries = 1;  // enough to connect, not to receive
    EXPECT_EQ(H().Connect(first), 1u);
    H().Connect(mute);
    EXPECT_EQ(H().Connect(second), 3u);
    ASSERT_EQ(H().Initialize(false, false), S_OK);
    EXPECT_EQ(order, (std::vector<RecordingSink*>{&first, &second}));
    EXPECT_TRUE(mute.received.empty());
    // The event names the very object the sinks are connected to.
    EXPECT_EQ(first.received[0].portManager, H().pm.Get());
}

TEST_F(PortManager, SinkMayRefreshFromInsideItsEvent) {
    RecordingSink& sink = NewSink();
    sink.onEvent = [&](PM_EVENT) {
        if (sink.received.size() == 1) {
            EXPECT_EQ(H().pm->Refresh(), S_OK);
        }
    };
    H().Connect(sink);
    ASSERT_EQ(H().Initialize(false, false), S_OK);
    EXPECT_EQ(sink.received.size(), 2u);  // the nested event came from inside the first
}

TEST_F(PortManager, AdviseAndUnadviseErrors) {
    ComPtr<IConnectionPointContainer> container;
    ASSERT_EQ(H().pm->QueryInterface(IID_IConnectionPointContainer, container.GetVoidAddressOf()),
              S_OK);
    ComPtr<IConnectionPoint> point;
    EXPECT_EQ(container->FindConnectionPoint(IID_IDispatch, point.GetAddressOf()),
              CONNECT_E_NOCONNECTION);
    ASSERT_EQ(
        container->FindConnectionPoint(DIID__IAdvancedPortManagerEvents, point.GetAddressOf()),
        S_OK);
    RecordingSink& refuser = NewSink();
    refuser.answerEventQueries = 0;
    DWORD cookie = 99;
    EXPECT_EQ(point->Advise(&refuser, &cookie), CONNECT_E_CANNOTCONNECT);
    EXPECT_EQ(refuser.refs.load(), 0u);
    RecordingSink& sink = NewSink();
    ASSERT_EQ(point->Advise(&sink, &cookie), S_OK);
    EXPECT_EQ(cookie, 1u);
    EXPECT_EQ(point->Unadvise(0), CONNECT_E_NOCONNECTION);
    EXPECT_EQ(point->Unadvise(2), CONNECT_E_NOCONNECTION);
    EXPECT_EQ(point->Unadvise(cookie), S_OK);
    EXPECT_EQ(point->Unadvise(cookie), CONNECT_E_NOCONNECTION);
    EXPECT_EQ(sink.refs.load(), 0u);
    // Releasing the object releases connected sinks.
    ASSERT_EQ(point->Advise(&sink, &cookie), S_OK);
    point.Reset();
    container.Reset();
    H().pm.Reset();
    EXPECT_EQ(sink.refs.load(), 0u);
}

TEST_F(PortManager, EnumeratorsListTheOnePointAndEveryLiveConnection) {
    ComPtr<IConnectionPointContainer> container;
    ASSERT_EQ(H().pm->QueryInterface(IID_IConnectionPointContainer, container.GetVoidAddressOf()),
              S_OK);
    ComPtr<IEnumConnectionPoints> points;
    ASSERT_EQ(container->EnumConnectionPoints(points.GetAddressOf()), S_OK);
    IConnectionPoint* found[2] = {};
    ULONG fetched = 9;
    EXPECT_EQ(points->Next(2, found, &fetched), S_FALSE);
    ASSERT_EQ(fetched, 1u);
    const ComPtr<IConnectionPoint> point = ComPtr<IConnectionPoint>::Attach(found[0]);
    IID iid{};
    point->GetConnectionInterface(&iid);
    EXPECT_EQ(iid, DIID__IAdvancedPortManagerEvents);
    EXPECT_EQ(points->Next(2, found, nullptr), E_POINTER);

    RecordingSink& first = NewSink();
    RecordingSink& second = NewSink();
    H().Connect(first);
    const DWORD cookie = H().Connect(second);
    ComPtr<IEnumConnections> connections;
    ASSERT_EQ(point->EnumConnections(connections.GetAddressOf()), S_OK);
    point->Unadvise(1);  // the snapshot keeps its own reference
    EXPECT_EQ(first.refs.load(), 1u);
    EXPECT_EQ(connections->Skip(1), S_OK);
    ComPtr<IEnumConnections> clone;
    ASSERT_EQ(connections->Clone(clone.GetAddressOf()), S_OK);
    CONNECTDATA data{};
    ASSERT_EQ(clone->Next(1, &data, nullptr), S_OK);
    EXPECT_EQ(data.dwCookie, cookie);
    EXPECT_EQ(data.pUnk, static_cast<IUnknown*>(&second));
    data.pUnk->Release();
    EXPECT_EQ(clone->Next(1, &data, nullptr), S_FALSE);
    EXPECT_EQ(connections->Skip(2), S_FALSE);
    connections.Reset();
    clone.Reset();
    EXPECT_EQ(first.refs.load(), 0u);
}

TEST_F(PortManager, EventObjectKeepsThePortManagerAndAcceptsANullPut) {
    ComPtr<IPortManagerUpdateEvent> kept;
    ASSERT_EQ(portmanager::PortManagerUpdateEvent::Create(kept.GetAddressOf()), S_OK);
    ASSERT_EQ(kept->put_PortManager(H().pm.Get()), S_OK);
    ComPtr<IAdvancedPortManager> pm;
    ASSERT_EQ(kept->get_PortManager(pm.GetAddressOf()), S_OK);
    EXPECT_EQ(pm.Get(), H().pm.Get());
    EXPECT_EQ(kept->put_PortManager(nullptr), S_OK);
    EXPECT_EQ(kept->get_PortManager(pm.GetAddressOf()), E_POINTER);
    EXPECT_FALSE(pm);
}

TEST_F(PortManager, InterfacesAndErrorInfo) {
    ComPtr<IPortMappingProvider> first;
    ComPtr<IPortMappingProvider> second;
    ASSERT_EQ(H().pm->QueryInterface(IID_IPortMappingProvider, first.GetVoidAddressOf()), S_OK);
    ASSERT_EQ(H().pm->QueryInterface(IID_IPortMappingProvider2, second.GetVoidAddressOf()), S_OK);
    EXPECT_EQ(first.Get(), second.Get());  // one implementation under two ids
    ComPtr<ISupportErrorInfo> info;
    ASSERT_EQ(H().pm->QueryInterface(IID_ISupportErrorInfo, info.GetVoidAddressOf()), S_OK);
    EXPECT_EQ(info->InterfaceSupportsErrorInfo(IID_IAdvancedPortManager), S_OK);
    EXPECT_EQ(info->InterfaceSupportsErrorInfo(IID_INqDiagnostics), S_FALSE);
    EXPECT_EQ(info->InterfaceSupportsErrorInfo(IID_IDispatch), S_FALSE);
    void* none = &info;
    EXPECT_EQ(H().pm->QueryInterface(IID_IConnectionPoint, &none), E_NOINTERFACE);
    EXPECT_EQ(none, nullptr);
}

TEST_F(PortManager, InitiateShutdownFiresShutdownOnceOnItsFirstTick) {
    RecordingSink& sink = NewSink();
    H().Connect(sink);
    ASSERT_EQ(H().pm->InitiateShutdown(), S_OK);
    PumpUntilEvents(sink, 1);
    EXPECT_EQ(sink.received[0].type, PME_SHUTDOWN);
    platform::RunMessageLoopUntil([] { return false; }, 1300);
    EXPECT_EQ(sink.received.size(), 1u);
}

}  // namespace
