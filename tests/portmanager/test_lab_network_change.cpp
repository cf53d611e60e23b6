// A route change made with `ip` in a namespace of the test reaches the client as exactly one
// PME_NETWORK_CHANGE, and the port manager starts no discovery by itself.
#include <gtest/gtest.h>

#include <deque>
#include <string>

#include "platform/message.h"
#include "tests/support/PortManagerDoubles.h"
#include "tests/support/os/netns.h"

namespace {

using testsupport::RecordingSink;

TEST(LabPortManagerNetworkChange, RouteChangeFiresOneEventAndChangesNoField) {
    if (!platform::testing::IsRoot()) {
        GTEST_SKIP() << "network namespaces need root";
    }
    platform::testing::ScopedNetns ns("pmnet");
    ASSERT_TRUE(ns.IsValid());
    ASSERT_TRUE(ns.Ip("link add eth0 type veth peer name peer0"));
    ASSERT_TRUE(ns.Ip("link set eth0 up"));
    ASSERT_TRUE(ns.Ip("link set peer0 up"));
    ASSERT_TRUE(ns.Ip("addr add 10.50.0.2/24 dev eth0"));
    ASSERT_TRUE(ns.Ip("route add default via 10.50.0.1 dev eth0"));
    ASSERT_TRUE(ns.Enter());  // the port manager and its monitor thread live in the namespace

    std::deque<RecordingSink> sinks;  // outlives the port manager
    {
        testsupport::PortManagerWithFakeStun h;
        RecordingSink& sink = sinks.emplace_back();
        h.Connect(sink);
        ASSERT_EQ(h.Initialize(false, false), S_OK);
        ASSERT_EQ(sink.received.size(), 1u);
        BStr before;
        h.pm->get_PrivateIpAddress(before.Out());
        EXPECT_EQ(before.Utf8(), "10.50.0.2");

        ASSERT_TRUE(ns.Ip("route add 10.60.0.0/24 via 10.50.0.1 dev eth0"));
        ASSERT_TRUE(platform::RunMessageLoopUntil([&] { return sink.received.size() >= 2; }, 5000));
        // One route, one notification: after the settle pause nothing more may come.
        platform::RunMessageLoopUntil([] { return false; }, 1500);
        ASSERT_EQ(sink.received.size(), 2u);
        EXPECT_EQ(sink.received[1].type, PME_NETWORK_CHANGE);
        EXPECT_EQ(sink.received[1].portManager, h.pm.Get());
        EXPECT_EQ(sink.received[1].state, PMS_COMPLETED);
        PM_TOPOLOGY topology{};
        h.pm->get_Topology(&topology);
        EXPECT_EQ(topology, PMT_UNKNOWN);
        BStr after;
        h.pm->get_PrivateIpAddress(after.Out());
        EXPECT_EQ(after.Utf8(), "10.50.0.2");
        BStr server;
        h.pm->get_RecommendedSipServer(server.Out());
        EXPECT_EQ(server.Utf8(), "media.example.net");
    }
    ns.Leave();
}

}  // namespace
