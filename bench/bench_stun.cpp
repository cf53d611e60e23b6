// STUN codec throughput: building and encoding a Binding Request, and decoding the 88-byte answer
// stund gives to a plain request. Pure byte work, no sockets.
#include <benchmark/benchmark.h>

#include <cstdint>
#include <cstdlib>
#include <vector>

#include "foundation/Logger.h"
#include "stun/STUNMessage.h"

namespace {

// MAPPED, SOURCE, CHANGED, the old XOR-MAPPED (0x0020) and SERVER "Vovida.org 0.97", as stund
// 0.97 sends them.
const std::vector<uint8_t>& StundResponse() {
    static const std::vector<uint8_t> bytes = {
        0x01, 0x01, 0x00, 0x44, 0x01, 0x08, 0x0F, 0x16, 0x1D, 0x24, 0x2B, 0x32, 0x39, 0x40, 0x47,
        0x4E, 0x55, 0x5C, 0x63, 0x6A, 0x00, 0x01, 0x00, 0x08, 0x00, 0x01, 0x9C, 0x40, 0xC0, 0xA8,
        0x0A, 0x14, 0x00, 0x04, 0x00, 0x08, 0x00, 0x01, 0x0D, 0x96, 0x7F, 0x0A, 0x0B, 0x01, 0x00,
        0x05, 0x00, 0x08, 0x00, 0x01, 0x0D, 0x97, 0x7F, 0x0A, 0x0B, 0x02, 0x00, 0x20, 0x00, 0x08,
        0x00, 0x01, 0x12, 0x34, 0x12, 0x34, 0x56, 0x78, 0x80, 0x22, 0x00, 0x10, 0x56, 0x6F, 0x76,
        0x69, 0x64, 0x61, 0x2E, 0x6F, 0x72, 0x67, 0x20, 0x30, 0x2E, 0x39, 0x37, 0x00,
    };
    return bytes;
}

void BM_BuildAndEncodeRequest(benchmark::State& state) {
    const bool change = state.range(0) != 0;
    uint8_t buffer[stun::kSTUNMaxRequestSize];
    stun::CSTUNMessage request;
    for (auto _ : state) {
        request.Reset();
        request.m_messageType = stun::STUN_BINDING_REQUEST;
        if (change) {
            request.m_changeRequest.m_type = stun::STUN_CHANGE_REQUEST;
            request.m_changeRequest.m_length = 4;
            request.m_changeRequest.m_flags = stun::STUN_CHANGE_IP | stun::STUN_CHANGE_PORT;
            request.m_messageLength = 8;
        }
        const size_t size = request.Encode(buffer, sizeof buffer);
        benchmark::DoNotOptimize(size);
        benchmark::DoNotOptimize(buffer);
    }
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_BuildAndEncodeRequest)->Arg(0)->Arg(1)->ArgName("changeRequest");

// The byte work alone, without drawing the 16 rand() bytes of a new transaction id.
void BM_EncodePreparedRequest(benchmark::State& state) {
    uint8_t buffer[stun::kSTUNMaxRequestSize];
    stun::CSTUNMessage request(stun::STUN_BINDING_REQUEST);
    request.m_changeRequest.m_type = stun::STUN_CHANGE_REQUEST;
    request.m_changeRequest.m_length = 4;
    request.m_changeRequest.m_flags = stun::STUN_CHANGE_IP | stun::STUN_CHANGE_PORT;
    request.m_responseAddress.m_type = stun::STUN_RESPONSE_ADDRESS;
    request.m_responseAddress.m_length = 8;
    request.m_responseAddress.m_family = stun::STUN_FAMILY_IPV4;
    request.m_responseAddress.m_port = 40000;
    request.m_responseAddress.m_address = 0x7F000001;
    request.m_messageLength = 20;
    for (auto _ : state) {
        benchmark::DoNotOptimize(request);
        const size_t size = request.Encode(buffer, sizeof buffer);
        benchmark::DoNotOptimize(size);
        benchmark::DoNotOptimize(buffer);
    }
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_EncodePreparedRequest);

void BM_DecodeStundResponse(benchmark::State& state) {
    // Logging on costs the INFO lines of the parse; off is the classification's usual case.
    foundation::Logger().SetEnabled(false);
    const std::vector<uint8_t>& datagram = StundResponse();
    stun::CSTUNMessage response;
    for (auto _ : state) {
        const bool ok = response.Decode(datagram.data(), datagram.size());
        benchmark::DoNotOptimize(ok);
        benchmark::DoNotOptimize(response);
    }
    if (!response.HasMandatoryAttributes()) {
        state.SkipWithError("the stund layout no longer parses");
    }
    state.SetItemsProcessed(state.iterations());
    state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(datagram.size()));
}
BENCHMARK(BM_DecodeStundResponse);

}  // namespace

BENCHMARK_MAIN();
