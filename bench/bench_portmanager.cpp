// Port mapping pools on loopback: filling the five pools of a profile (one placeholder socket per
// port, every taken port costing a failed bind) and handing one mapping out and taking it back.
#include <benchmark/benchmark.h>

#include <array>
#include <cstdint>
#include <cstdlib>

#include "portmanager/PortMappingPool.h"

namespace {

using portmanager::MappedServiceEndpoint;
using portmanager::PortMappingPool;

constexpr const char* kLoopback = "127.0.0.1";
constexpr const char* kPublic = "198.51.100.7";
constexpr int32_t kMinPort = 40000;
constexpr int32_t kMaxPort = 50240;
constexpr uint32_t kPortsPerPool = 1024;

// The pools of a profile in the order they are filled: spare, audio RTP, audio RTCP, video RTP,
// video RTCP.
constexpr std::array<bool, 5> kEven = {true, true, false, true, false};

struct Pools {
    std::array<PortMappingPool, 5> pools;
    ~Pools() {
        for (PortMappingPool& pool : pools) {
            pool.CloseFree();
        }
    }
};

// Arg: randomize. Every iteration after the first also closes the previous fill's sockets, as a
// second enable of a profile does.
void BM_FillFivePools(benchmark::State& state) {
    const bool randomize = state.range(0) != 0;
    std::srand(1);
    Pools p;
    for (auto _ : state) {
        for (size_t i = 0; i < p.pools.size(); ++i) {
            if (!p.pools[i].Fill(kEven[i], kPortsPerPool, kMinPort, kMaxPort, kLoopback, kPublic,
                                 randomize)) {
                state.SkipWithError("too many ports of 40000-50240 taken (or ulimit -n < 5200)");
                return;
            }
        }
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64_t>(p.pools.size()) *
                            kPortsPerPool);
}
BENCHMARK(BM_FillFivePools)->ArgName("randomize")->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);

// One GetMapping (placeholder closed) and one ReleaseMapping (placeholder bound again).
void BM_GetReleaseRoundTrip(benchmark::State& state) {
    Pools p;
    PortMappingPool& pool = p.pools[0];
    if (!pool.Fill(true, 16, kMinPort, kMaxPort, kLoopback, kPublic, false)) {
        state.SkipWithError("no free even ports in 40000-50240");
        return;
    }
    MappedServiceEndpoint mapping;
    for (auto _ : state) {
        pool.GetMapping(mapping);
        pool.ReleaseMapping(mapping);
    }
    if (mapping.m_socket == foundation::kInvalidSocket) {
        state.SkipWithError("a released port could not be bound again");
    }
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_GetReleaseRoundTrip);

}  // namespace

BENCHMARK_MAIN();
