// A port manager on loopback whose discovery found 127.0.0.1 behind a NAT with the public
// address 127.0.0.2, its SIP profile enabled and its SIP server on a loopback socket; a local
// SIP proxy to start with it; and the raw client and server sockets around the proxy.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <deque>
#include <filesystem>
#include <optional>
#include <string>

#include "portmanager/PortMapping.h"
#include "sipproxy/LocalSipProxy.h"
#include "tests/portmanager/port_mapping_test_support.h"
#include "tests/support/FakeNetworkInfo.h"
#include "tests/support/PortManagerDoubles.h"

namespace sipproxy::testing {

using portmanager::testing::LoopbackSocket;

inline constexpr const char* kPublicAddress = "127.0.0.2";

inline int CountThreads() {
    int n = 0;
    for ([[maybe_unused]] const auto& entry :
         std::filesystem::directory_iterator("/proc/self/task")) {
        ++n;
    }
    return n;
}

inline std::string Text(const LoopbackSocket::Datagram& d) {
    return std::string(d.bytes.begin(), d.bytes.end());
}

class ProxyFixture : public ::testing::Test {
  protected:
    // sipServer empty: the loopback server socket.
    void SetUpPortManager(std::string sipServer = {}) {
        net.AddInterface("127.0.0.1", "");
        const auto base = portmanager::testing::FindFreeWindow(24);
        ASSERT_TRUE(base.has_value()) << "no free window of loopback ports";
        if (sipServer.empty()) {
            sipServer = "127.0.0.1:" + std::to_string(server.Port());
        }
        h.nextList.count = 1;
        h.nextList.entries[0] = {portmanager::testing::kLoopbackHost,
                                 stun::STUN_RESULT_FULL_CONE_NAT, publicHost};
        h.Connect(sink);
        ASSERT_EQ(h.Initialize(false, true, sipServer.c_str(), "media.lab.test"), S_OK);
        ASSERT_TRUE(platform::RunMessageLoopUntil([&] { return !sink.received.empty(); }, 5000));
        VARIANT v;
        VariantInit(&v);
        v.vt = VT_ARRAY | VT_BSTR;
        v.parray = MakeBstrArray({"127.0.0.1:" + std::to_string(*base + 22)});
        ASSERT_EQ(h.pm->OnBeforeEnableProfileEx(v, *base, *base + 20, 2, VARIANT_FALSE), S_OK);
        VariantClear(&v);
        sipMappingPort = static_cast<uint16_t>(*base + 22);
    }
    void SetUp() override {
        SetUpPortManager();
        ASSERT_EQ(
            CLocalSipProxy::CreateInstance(IID_ILocalSipProxy, reinterpret_cast<void**>(&proxy)),
            S_OK);
    }
    void TearDown() override {
        if (proxy != nullptr) {
            proxy->Release();
        }
    }

    HRESULT SetInternal(const char* address = "127.0.0.1") {
        BStr a(address);
        return proxy->put_InternalAddress(a.Get());
    }
    HRESULT StartProxy() {
        const HRESULT hr = SetInternal();
        return FAILED(hr) ? hr : proxy->Start(h.pm.Get(), 0, 0, VARIANT_FALSE);
    }
    std::string SenderEndpoint() {
        BStr e;
        EXPECT_EQ(proxy->get_SenderEndpoint(e.Out()), S_OK);
        return e.Utf8();
    }
    uint16_t InternalPort() {
        const std::string e = SenderEndpoint();
        return static_cast<uint16_t>(std::stoi(e.substr(e.find(':') + 1)));
    }
    // The next datagram at the server that the proxy sent. The port manager's keep-alives from
    // its SIP mapping are passed over by their bytes: the proxy's rotating external port may
    // well be the mapping's port, free again once the mapping is taken.
    std::optional<LoopbackSocket::Datagram> ServerReceive() {
        for (;;) {
            auto d = server.Receive();
            if (!d || d->fromPort != sipMappingPort ||
                !std::equal(d->bytes.begin(), d->bytes.end(), std::begin(portmanager::kKeepAlive),
                            std::end(portmanager::kKeepAlive))) {
                return d;
            }
        }
    }

    static void SendTo(LoopbackSocket& from, const std::string& text, uint16_t port) {
        platform::SendTo(from.Handle(), text.data(), text.size(),
                         portmanager::testing::kLoopbackHost, port);
    }

    // A REGISTER from the client through the proxy and its 200 OK back; the external port of
    // the proxy is learned on the way.
    void ExpectRegisterRelayed(LoopbackSocket& client, const std::string& branch) {
        const std::string self = "127.0.0.1:" + std::to_string(client.Port());
        SendTo(client,
               "REGISTER sip:lab.test SIP/2.0\r\nVia: SIP/2.0/UDP " + self + ";branch=" + branch +
                   "\r\nContact: <sip:alice@" + self + ">\r\nContent-Length: 0\r\n\r\n",
               InternalPort());
        const auto request = ServerReceive();
        ASSERT_TRUE(request.has_value()) << "the REGISTER did not reach the server";
        externalPort = request->fromPort;
        const std::string contact =
            std::string(kPublicAddress) + ":" + std::to_string(externalPort);
        EXPECT_EQ(Text(*request), "REGISTER sip:lab.test SIP/2.0\r\nVia: SIP/2.0/UDP " + contact +
                                      ";branch=" + branch + "\r\nContact: <sip:alice@" + contact +
                                      ">\r\nContent-Length: 0\r\n\r\n");
        SendTo(server,
               "SIP/2.0 200 OK\r\nVia: SIP/2.0/UDP " + contact + ";branch=" + branch +
                   "\r\nContact: <sip:alice@" + contact + ">\r\n\r\n",
               externalPort);
        const auto answer = client.Receive();
        ASSERT_TRUE(answer.has_value()) << "the 200 OK did not reach the client";
        EXPECT_EQ(Text(*answer), "SIP/2.0 200 OK\r\nVia: SIP/2.0/UDP " + self + ";branch=" +
                                     branch + "\r\nContact: <sip:alice@" + self + ">\r\n\r\n");
    }

    testsupport::FakeNetworkInfo net;
    testsupport::RecordingSink sink;
    LoopbackSocket server;
    testsupport::PortManagerWithFakeStun h{testsupport::ServicesWith(net)};
    uint32_t publicHost = 0x7F000002;  // kPublicAddress
    uint16_t sipMappingPort = 0;
    uint16_t externalPort = 0;
    ILocalSipProxy* proxy = nullptr;
};

}  // namespace sipproxy::testing
