// Pools of placeholder-held ports on loopback: filling, handing out and taking back.
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdlib>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/net.h"
#include "portmanager/PortMappingPool.h"
#include "tests/portmanager/port_mapping_test_support.h"

namespace portmanager {
namespace {

using testing::FreeOffsets;
using testing::kLoopback;
using testing::LogCapture;
using testing::LoopbackSocket;
using testing::ScopedPool;

constexpr const char* kPublic = "198.51.100.7";
constexpr int32_t kWindow = 128;

bool IsHeld(int32_t port) {
    return !LoopbackSocket(static_cast<uint16_t>(port)).IsBound();
}

// Every test works in a window of ports that was free when it started.
class PortMappingPoolTest : public ::testing::Test {
  protected:
    void SetUp() override {
        const auto base = testing::FindFreeWindow(kWindow);
        if (!base) {
            GTEST_SKIP() << "no window of " << kWindow << " free loopback ports";
        }
        m_base = *base;
    }

    bool Fill(PortMappingPool& pool, bool even, uint32_t count, int32_t minOffset,
              int32_t maxOffset, bool randomize = false) {
        return pool.Fill(even, count, m_base + minOffset, m_base + maxOffset, kLoopback, kPublic,
                         randomize);
    }

    int32_t m_base = 0;
};

TEST_F(PortMappingPoolTest, FiveFillsShareOneRangeAsTheProfileDoes) {
    struct Case {
        int32_t maxOffset;
        // spare, audio RTP, audio RTCP, video RTP, video RTCP; a pool after a failed fill is
        // left untouched
        std::array<std::vector<int32_t>, 5> offsets;
        int poolsFilled;
    };
    const Case cases[] = {
        {10, {{{0, 2}, {4, 6}, {1, 3}, {8}, {}}}, 3},
        {11, {{{0, 2}, {4, 6}, {1, 3}, {8, 10}, {5, 7}}}, 5},
    };
    const std::array<bool, 5> parities = {true, true, false, true, false};
    for (const Case& c : cases) {
        SCOPED_TRACE("maxPort = base + " + std::to_string(c.maxOffset));
        std::array<ScopedPool, 5> pools;
        int filled = 0;
        while (filled < 5 && Fill(pools[filled], parities[filled], 2, 0, c.maxOffset)) {
            ++filled;
        }
        EXPECT_EQ(filled, c.poolsFilled);
        for (size_t i = 0; i < pools.size(); ++i) {
            EXPECT_EQ(FreeOffsets(pools[i], m_base), c.offsets[i]) << "pool " << i;
            for (const MappedServiceEndpoint& m : pools[i].Free()) {
                EXPECT_EQ(m.m_private.m_address, kLoopback);
                EXPECT_EQ(m.m_public.m_address, kPublic);
                EXPECT_EQ(m.m_public.m_port, m.m_private.m_port);
                EXPECT_NE(m.m_socket, platform::kInvalidSocket);
                EXPECT_TRUE(IsHeld(m.m_private.m_port));
            }
        }
    }
}

TEST_F(PortMappingPoolTest, ScanTakesTheParityInAscendingOrderUntilTheCount) {
    struct Case {
        bool even;
        uint32_t count;
        int32_t minOffset;
        bool result;
        std::vector<int32_t> offsets;
    };
    const Case cases[] = {
        // the count is tested after adding, so 0 and 1 both give one mapping
        {true, 0, 0, true, {0}},
        {true, 1, 0, true, {0}},
        {true, 3, 0, true, {0, 2, 4}},
        {false, 0, 0, true, {1}},
        {false, 3, 0, true, {1, 3, 5}},
        {true, 2, 1, true, {2, 4}},
        {false, 2, 1, true, {1, 3}},
        // the range [base, base + 10) runs out: what was found stays
        {true, 6, 0, false, {0, 2, 4, 6, 8}},
        {false, UINT32_MAX, 0, false, {1, 3, 5, 7, 9}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(::testing::Message() << "even " << c.even << ", count " << c.count
                                          << ", min offset " << c.minOffset);
        ScopedPool pool;
        EXPECT_EQ(Fill(pool, c.even, c.count, c.minOffset, 10), c.result);
        EXPECT_EQ(FreeOffsets(pool, m_base), c.offsets);
    }
}

TEST_F(PortMappingPoolTest, RandomFillStaysInTheRangeWithoutDuplicates) {
    struct Case {
        unsigned seed;
        bool even;
    };
    constexpr uint32_t kCount = 20;
    for (const Case c : {Case{1, true}, Case{2, false}, Case{12345, true}, Case{777, false}}) {
        SCOPED_TRACE(::testing::Message() << "seed " << c.seed << ", even " << c.even);
        std::srand(c.seed);
        ScopedPool pool;
        ASSERT_TRUE(Fill(pool, c.even, kCount, 0, kWindow, true));
        const std::vector<int32_t> offsets = FreeOffsets(pool, m_base);
        ASSERT_EQ(offsets.size(), kCount);
        for (const int32_t offset : offsets) {
            EXPECT_GE(offset, 0);
            EXPECT_LT(offset, kWindow);
            EXPECT_EQ(offset % 2 == 0, c.even) << offset;
        }
        EXPECT_EQ(std::set<int32_t>(offsets.begin(), offsets.end()).size(), offsets.size());
        // The random phase ran: an ascending scan would have found the lowest ports in order.
        std::vector<int32_t> lowest;
        for (int32_t offset = c.even ? 0 : 1; lowest.size() < kCount; offset += 2) {
            lowest.push_back(offset);
        }
        EXPECT_NE(offsets, lowest);
    }
}

TEST_F(PortMappingPoolTest, RandomCandidatesStayWithin32767AboveMinPort) {
    // A range up to INT32_MAX: with the full 31-bit rand() nearly every candidate would lie
    // beyond 65535 and the scan would take the lowest ports instead.
    std::srand(4242);
    ScopedPool pool;
    ASSERT_TRUE(pool.Fill(true, 8, m_base, INT32_MAX, kLoopback, kPublic, true));
    int32_t highest = 0;
    for (const int32_t offset : FreeOffsets(pool, m_base)) {
        EXPECT_GE(offset, 0);
        EXPECT_LE(offset, 32767);
        EXPECT_EQ(offset % 2, 0);
        highest = std::max(highest, offset);
    }
    EXPECT_GT(highest, kWindow);
}

TEST_F(PortMappingPoolTest, RangesWithoutABindablePortFailAndBindNothing) {
    struct Case {
        const char* name;
        int64_t minPort;  // relative to the base when `relative`
        int64_t maxPort;
        bool relative;
    };
    const Case cases[] = {
        {"empty", 0, 0, true},
        {"inverted", 10, 0, true},
        {"negative", -100, 0, false},
        {"beyond 16 bits (must not wrap)", 65536, 70000, false},
        {"at the top of int32", INT32_MAX - 2, INT32_MAX, false},
        {"at the bottom of int32", INT32_MIN, INT32_MIN + 100, false},
        // 0 - INT32_MIN does not fit in 32 bits
        {"across the bottom of int32 up to 0", INT32_MIN, 0, false},
    };
    const int before = platform::CountOpenDescriptors();
    for (const Case& c : cases) {
        for (const bool randomize : {false, true}) {
            SCOPED_TRACE(::testing::Message() << c.name << ", randomize " << randomize);
            const int64_t offset = c.relative ? m_base : 0;
            ScopedPool pool;
            EXPECT_FALSE(pool.Fill(true, 1, static_cast<int32_t>(c.minPort + offset),
                                   static_cast<int32_t>(c.maxPort + offset), kLoopback, kPublic,
                                   randomize));
            EXPECT_TRUE(pool.Free().empty());
            EXPECT_EQ(platform::CountOpenDescriptors(), before);
        }
    }
}

TEST_F(PortMappingPoolTest, PortsHeldByOthersAreSkipped) {
    const LoopbackSocket plain(static_cast<uint16_t>(m_base));
    const LoopbackSocket reusing(static_cast<uint16_t>(m_base + 4), true);
    ASSERT_TRUE(plain.IsBound());
    ASSERT_TRUE(reusing.IsBound());
    ScopedPool pool;
    ASSERT_TRUE(Fill(pool, true, 3, 0, 20));
    EXPECT_EQ(FreeOffsets(pool, m_base), (std::vector<int32_t>{2, 6, 8}));
}

TEST_F(PortMappingPoolTest, EveryFillClosesThePreviousFreeList) {
    const int before = platform::CountOpenDescriptors();
    ScopedPool pool;
    ASSERT_TRUE(Fill(pool, true, 4, 0, 20));
    EXPECT_EQ(platform::CountOpenDescriptors(), before + 4);
    // The same ports again: only possible when their placeholders were closed first.
    ASSERT_TRUE(Fill(pool, true, 4, 0, 20));
    EXPECT_EQ(FreeOffsets(pool, m_base), (std::vector<int32_t>{0, 2, 4, 6}));
    EXPECT_EQ(platform::CountOpenDescriptors(), before + 4);
    ASSERT_TRUE(Fill(pool, false, 2, 0, 20));
    EXPECT_EQ(platform::CountOpenDescriptors(), before + 2);
    EXPECT_FALSE(IsHeld(m_base));

    pool.CloseFree();
    EXPECT_TRUE(pool.Free().empty());
    EXPECT_EQ(platform::CountOpenDescriptors(), before);
    EXPECT_FALSE(IsHeld(m_base + 1));
}

TEST_F(PortMappingPoolTest, GetMappingHandsOutTheFrontWithItsPortReleased) {
    ScopedPool pool;
    ASSERT_TRUE(Fill(pool, true, 3, 0, 20));
    const int before = platform::CountOpenDescriptors();
    LogCapture log;

    MappedServiceEndpoint first;
    MappedServiceEndpoint second;
    ASSERT_TRUE(pool.GetMapping(first));
    ASSERT_TRUE(pool.GetMapping(second));
    EXPECT_EQ(first.m_private.m_port, m_base);
    EXPECT_EQ(second.m_private.m_port, m_base + 2);
    EXPECT_EQ(first.m_public.m_address, kPublic);
    EXPECT_EQ(first.m_public.m_port, m_base);
    EXPECT_EQ(first.m_socket, platform::kInvalidSocket);
    EXPECT_EQ(second.m_socket, platform::kInvalidSocket);
    EXPECT_EQ(platform::CountOpenDescriptors(), before - 2);
    // The client can bind what it was given.
    EXPECT_TRUE(LoopbackSocket(static_cast<uint16_t>(first.m_private.m_port)).IsBound());
    EXPECT_TRUE(pool.IsInUse(m_base));
    EXPECT_TRUE(pool.IsInUse(m_base + 2));
    EXPECT_FALSE(pool.IsInUse(m_base + 4));
    EXPECT_EQ(FreeOffsets(pool, m_base), (std::vector<int32_t>{4}));

    const auto lines = log.LinesOf("PortMappingPool::GetMapping");
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_EQ(lines[0].level, "INFO");
    EXPECT_EQ(lines[0].message, first.ToString());
    EXPECT_EQ(lines[1].message, second.ToString());
}

TEST_F(PortMappingPoolTest, ReleasedMappingIsHeldAgainAndHandedOutFirst) {
    ScopedPool pool;
    ASSERT_TRUE(Fill(pool, true, 3, 0, 20));
    MappedServiceEndpoint first;
    MappedServiceEndpoint second;
    ASSERT_TRUE(pool.GetMapping(first));
    ASSERT_TRUE(pool.GetMapping(second));
    LogCapture log;

    // As the port manager gives it back: rebuilt from the four values, no socket.
    MappedServiceEndpoint released(first.m_private, {kPublic, 0});
    pool.ReleaseMapping(released);
    EXPECT_NE(released.m_socket, platform::kInvalidSocket);
    EXPECT_EQ(released.m_public.m_port, first.m_private.m_port);
    EXPECT_TRUE(IsHeld(first.m_private.m_port));
    EXPECT_FALSE(pool.IsInUse(first.m_private.m_port));
    EXPECT_TRUE(pool.IsInUse(second.m_private.m_port));
    ASSERT_FALSE(pool.Free().empty());
    EXPECT_EQ(pool.Free().front().m_socket, released.m_socket);

    const auto lines = log.LinesOf("PortMappingPool::ReleaseMapping");
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].level, "INFO");
    EXPECT_EQ(lines[0].message,
              "MappedServiceEndpoint is Media - " +
                  MappedServiceEndpoint(first.m_private, {kPublic, 0}).ToString());

    MappedServiceEndpoint again;
    ASSERT_TRUE(pool.GetMapping(again));
    EXPECT_EQ(again.m_private.m_port, first.m_private.m_port);
    EXPECT_FALSE(IsHeld(again.m_private.m_port));
}

TEST_F(PortMappingPoolTest, ReleaseOfAMappingNotInUseOrStillBound) {
    struct Case {
        const char* name;
        bool handOutFirst;   // the port is in the in-use list
        bool clientKeepsIt;  // the client's socket still holds the port
        bool assertion;
        bool rebound;
    };
    const Case cases[] = {
        {"never handed out", false, false, true, true},
        {"client still bound", true, true, false, false},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        ScopedPool pool;
        ASSERT_TRUE(Fill(pool, true, 2, 0, 20));
        MappedServiceEndpoint mapping({kLoopback, m_base + 30}, {kPublic, m_base + 30});
        if (c.handOutFirst) {
            ASSERT_TRUE(pool.GetMapping(mapping));
        }
        std::optional<LoopbackSocket> client;
        if (c.clientKeepsIt) {
            ASSERT_TRUE(client.emplace(static_cast<uint16_t>(mapping.m_private.m_port)).IsBound());
        }
        LogCapture log;
        pool.ReleaseMapping(mapping);

        bool assertionLogged = false;
        for (const auto& line : log.LinesOf("PortMappingPool::ReleaseMapping")) {
            if (line.level == "ERROR") {
                EXPECT_EQ(line.message, "Failed Assertion - found");
                assertionLogged = true;
            }
        }
        EXPECT_EQ(assertionLogged, c.assertion);
        EXPECT_EQ(mapping.m_socket != platform::kInvalidSocket, c.rebound);
        EXPECT_FALSE(pool.IsInUse(mapping.m_private.m_port));
        // Back at the front either way, with or without a placeholder.
        ASSERT_FALSE(pool.Free().empty());
        EXPECT_EQ(pool.Free().front().m_private.m_port, mapping.m_private.m_port);
        EXPECT_EQ(pool.Free().front().m_socket, mapping.m_socket);
    }
}

TEST_F(PortMappingPoolTest, EmptyFreeListHandsOutNothing) {
    ScopedPool pool;
    LogCapture log;
    MappedServiceEndpoint mapping({"untouched", 1}, {"untouched", 2});
    EXPECT_FALSE(pool.GetMapping(mapping));

    ASSERT_TRUE(Fill(pool, false, 1, 0, 20));
    MappedServiceEndpoint only;
    ASSERT_TRUE(pool.GetMapping(only));
    log.Clear();
    EXPECT_FALSE(pool.GetMapping(mapping));
    EXPECT_EQ(mapping.m_private, NetworkEndpoint("untouched", 1));
    EXPECT_EQ(mapping.m_public, NetworkEndpoint("untouched", 2));
    EXPECT_EQ(pool.InUse().size(), 1u);
    EXPECT_TRUE(log.Lines().empty());
}

}  // namespace
}  // namespace portmanager
