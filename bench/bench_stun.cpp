// STUN codec throughput: building and encoding a Binding Request, and decoding the 88-byte answer
// stund gives to a plain request. Pure byte work, no sockets.
#include <benchmark/benchmark.h>

#include <cstdint>
#include <cstdlib>
#include <vector>

#include "foundation/Logger.h"
#include "stun/STUNMessage.h"
#include "tests/support/StunBytes.h"

namespace {

using testsupport::Put16;
using testsupport::PutAddress;

// MAPPED, SOURCE, CHANGED, the old XOR-MAPPED (0x0020) and SERVER, as stund 0.97 sends them.
std::vector<uint8_t> StundResponse() {
    std::vector<uint8_t> out;
    Put16(out, 0x0101);
    Put16(out, 68);
    for (int i = 0; i < 16; ++i) {
        out.push_back(static_cast<uint8_t>(i * 7 + 1));
    }
    PutAddress(out, 0x0001, 0xC0A80A14, 40000);
    PutAddress(out, 0x0004, 0x7F0A0B01, 3478);
    PutAddress(out, 0x0005, 0x7F0A0B02, 3479);
    PutAddress(out, 0x0020, 0x12345678, 0x1234);
    const char server[] = "Vovida.org 0.97";  // 16 bytes with the terminator
    Put16(out, 0x8022);
    Put16(out, sizeof server);
    out.insert(out.end(), server, server + sizeof server);
    return out;
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
    const std::vector<uint8_t> datagram = StundResponse();
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
