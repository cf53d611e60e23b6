// Pools of placeholder-held ports on loopback: filling, handing out and taking back.
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdlib>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/net.h"
#include "portmanager/PortMappingPool.h"
#include "tests/portmanager/port_mapping_test_support.h"

namespace portmanager {
namespace {

using testing::FreeOffsets;
using testing::IsHeld;
using testing::kLoopback;
using testing::LogCapture;
using testing::LoopbackSocket;
using testing::ScopedPool;

constexpr const char* kPublic = "198.51.100.7";
constexpr int32_t kWindow = 128;

class PortMappingPoolTest : public ::testing::Test {
  protected:
    void SetUp() override {
        const auto base = testing::FindFreeWindow(kWindow);
        ASSERT_TRUE(base.has_value());
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
    // spare, audio RTP, audio RTCP, video RTP, video RTCP; a failed fill ends the sequence.
    // Each pool skipping the ports of the ones before shows that their placeholders hold them.
    const bool even[] = {true, true, false, true, false};
    const std::pair<int32_t, std::vector<std::vector<int32_t>>> cases[] = {
        {10, {{0, 2}, {4, 6}, {1, 3}, {8}}},
        {11, {{0, 2}, {4, 6}, {1, 3}, {8, 10}, {5, 7}}},
    };
    for (const auto& [maxOffset, expected] : cases) {
        SCOPED_TRACE(maxOffset);
        std::array<ScopedPool, 5> pools;
        for (size_t i = 0; i < expected.size(); ++i) {
            EXPECT_EQ(Fill(pools[i], even[i], 2, 0, maxOffset), expected[i].size() == 2) << i;
            EXPECT_EQ(FreeOffsets(pools[i], m_base), expected[i]) << i;
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
    constexpr uint32_t kCount = 20;
    for (const auto& [seed, even] :
         {std::pair{1u, true}, {2u, false}, {12345u, true}, {777u, false}}) {
        SCOPED_TRACE(::testing::Message() << "seed " << seed);
        std::srand(seed);
        ScopedPool pool;
        ASSERT_TRUE(Fill(pool, even, kCount, 0, kWindow, true));
        const std::vector<int32_t> offsets = FreeOffsets(pool, m_base);
        ASSERT_EQ(offsets.size(), kCount);
        for (const int32_t offset : offsets) {
            EXPECT_GE(offset, 0);
            EXPECT_LT(offset, kWindow);
            EXPECT_EQ(offset % 2 == 0, even) << offset;
        }
        EXPECT_EQ(std::set<int32_t>(offsets.begin(), offsets.end()).size(), offsets.size());
        // The random phase ran: an ascending scan would have found the lowest ports in order.
        std::vector<int32_t> lowest;
        for (int32_t offset = even ? 0 : 1; lowest.size() < kCount; offset += 2) {
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
    const std::pair<int32_t, int32_t> cases[] = {
        {m_base, m_base},
        {m_base + 10, m_base},  // inverted
        {-100, 0},
        {65536, 70000},  // must not wrap
        {INT32_MAX - 2, INT32_MAX},
        {INT32_MIN, INT32_MIN + 100},
        {INT32_MIN, 0},  // the width does not fit in 32 bits
    };
    for (const auto& [minPort, maxPort] : cases) {
        for (const bool randomize : {false, true}) {
            SCOPED_TRACE(::testing::Message() << minPort << ".." << maxPort << " " << randomize);
            ScopedPool pool;
            EXPECT_FALSE(pool.Fill(true, 1, minPort, maxPort, kLoopback, kPublic, randomize));
            EXPECT_TRUE(pool.Free().empty());
        }
    }
}

TEST_F(PortMappingPoolTest, FillsSkipTakenPortsAndCloseThePreviousFreeList) {
    const LoopbackSocket plain(static_cast<uint16_t>(m_base));
    const LoopbackSocket reusing(static_cast<uint16_t>(m_base + 4), true);
    ASSERT_TRUE(plain.IsBound() && reusing.IsBound());
    const int before = platform::CountOpenDescriptors();
    ScopedPool pool;
    ASSERT_TRUE(Fill(pool, true, 3, 0, 20));
    EXPECT_EQ(FreeOffsets(pool, m_base), (std::vector<int32_t>{2, 6, 8}));
    EXPECT_EQ(platform::CountOpenDescriptors(), before + 3);
    // The same ports again: only possible when their placeholders were closed first.
    ASSERT_TRUE(Fill(pool, true, 3, 0, 20));
    EXPECT_EQ(FreeOffsets(pool, m_base), (std::vector<int32_t>{2, 6, 8}));
    EXPECT_EQ(platform::CountOpenDescriptors(), before + 3);
    ASSERT_TRUE(Fill(pool, false, 2, 0, 20));
    EXPECT_EQ(platform::CountOpenDescriptors(), before + 2);
    EXPECT_FALSE(IsHeld(m_base + 2));

    pool.CloseFree();
    EXPECT_TRUE(pool.Free().empty());
    EXPECT_EQ(platform::CountOpenDescriptors(), before);
    EXPECT_FALSE(IsHeld(m_base + 1));
}

TEST_F(PortMappingPoolTest, HandsOutTheFrontAndTakesBackToTheFront) {
    ScopedPool pool;
    ASSERT_TRUE(Fill(pool, true, 3, 0, 20));
    const int before = platform::CountOpenDescriptors();
    LogCapture log;
    MappedServiceEndpoint first;
    MappedServiceEndpoint second;
    ASSERT_TRUE(pool.GetMapping(first));
    ASSERT_TRUE(pool.GetMapping(second));
    EXPECT_EQ(first.m_private, NetworkEndpoint(kLoopback, m_base));
    EXPECT_EQ(first.m_public, NetworkEndpoint(kPublic, m_base));
    EXPECT_EQ(first.m_socket, platform::kInvalidSocket);
    EXPECT_EQ(platform::CountOpenDescriptors(), before - 2);  // the client's to bind now
    EXPECT_TRUE(pool.IsInUse(m_base));
    EXPECT_FALSE(pool.IsInUse(m_base + 4));
    EXPECT_EQ(FreeOffsets(pool, m_base), (std::vector<int32_t>{4}));

    // Rebuilt from the four values, as the port manager gives it back.
    MappedServiceEndpoint released(first.m_private, {kPublic, 0});
    const std::string releasedText = released.ToString();
    pool.ReleaseMapping(released);
    EXPECT_NE(released.m_socket, platform::kInvalidSocket);
    EXPECT_EQ(released.m_public.m_port, m_base);
    EXPECT_TRUE(IsHeld(m_base));
    EXPECT_FALSE(pool.IsInUse(m_base));
    EXPECT_TRUE(pool.IsInUse(m_base + 2));
    {
        // Still bound by the client: taken back without a placeholder.
        const LoopbackSocket client(static_cast<uint16_t>(m_base + 2));
        ASSERT_TRUE(client.IsBound());
        pool.ReleaseMapping(second);
    }
    EXPECT_EQ(second.m_socket, platform::kInvalidSocket);
    EXPECT_FALSE(pool.IsInUse(m_base + 2));
    // Never handed out: a failed assertion, then taken back all the same.
    MappedServiceEndpoint stranger({kLoopback, m_base + 30}, {kPublic, m_base + 30});
    pool.ReleaseMapping(stranger);
    EXPECT_NE(stranger.m_socket, platform::kInvalidSocket);
    EXPECT_FALSE(pool.IsInUse(m_base + 30));
    EXPECT_EQ(FreeOffsets(pool, m_base), (std::vector<int32_t>{30, 2, 0, 4}));
    EXPECT_EQ(pool.Free()[0].m_socket, stranger.m_socket);
    EXPECT_EQ(pool.Free()[1].m_socket, platform::kInvalidSocket);
    EXPECT_EQ(pool.Free()[2].m_socket, released.m_socket);

    const auto got = log.LinesOf("PortMappingPool::GetMapping");
    ASSERT_EQ(got.size(), 2u);
    EXPECT_EQ(got[0].level, "INFO");
    EXPECT_EQ(got[0].message, first.ToString());
    EXPECT_EQ(got[1].message, second.ToString());
    const auto back = log.LinesOf("PortMappingPool::ReleaseMapping");
    ASSERT_EQ(back.size(), 4u);
    EXPECT_EQ(back[0].level, "INFO");
    EXPECT_EQ(back[0].message, "MappedServiceEndpoint is Media - " + releasedText);
    EXPECT_EQ(back[3].level, "ERROR");
    EXPECT_EQ(back[3].message, "Failed Assertion - found");
}

TEST(PortMappingPool, EmptyFreeListHandsOutNothing) {
    PortMappingPool pool;
    LogCapture log;
    MappedServiceEndpoint mapping({"untouched", 1}, {"untouched", 2});
    EXPECT_FALSE(pool.GetMapping(mapping));
    EXPECT_EQ(mapping.m_private, NetworkEndpoint("untouched", 1));
    EXPECT_EQ(mapping.m_public, NetworkEndpoint("untouched", 2));
    EXPECT_TRUE(pool.InUse().empty());
    EXPECT_TRUE(log.Lines().empty());
}

}  // namespace
}  // namespace portmanager
