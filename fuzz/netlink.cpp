// A datagram of the kernel's route notifications.
#include <vector>

#include "fuzz/FuzzSupport.h"
#include "platform/netchange.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const platform::NetworkChanges all = platform::ParseNetworkChanges(data, size);
    FUZZ_CHECK(!all.failed);
    // More bytes can only complete a header that did not fit: a shorter datagram never names a
    // kind the whole one does not. The prefix is a buffer of its own, so a read past it shows.
    const size_t cut = size == 0 ? 0 : data[0] % size;
    const std::vector<uint8_t> prefix(data, data + cut);
    const platform::NetworkChanges part = platform::ParseNetworkChanges(prefix.data(), cut);
    FUZZ_CHECK(!part.failed && (!part.addresses || all.addresses) && (!part.routes || all.routes));
    return 0;
}
