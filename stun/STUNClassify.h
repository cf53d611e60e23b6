// The classic RFC 3489 test sequence that classifies the path from one local address to the
// Internet, and the choice of the first answering server of a list.
#pragma once

#include <cstdint>

#include "stun/STUNResults.h"

namespace stun {

inline constexpr uint16_t kSTUNPort = 3478;
inline constexpr size_t kServerTokenSize = 256;

// Reads entry.localAddress (host order); writes entry.stunResult and entry.publicAddress.
// Blocks for up to about 19 s; returns early (with whatever it had) when the calling thread's
// owner asks it to stop.
void STUN_GetResult(uint32_t serverAddress, uint16_t serverPort, STUNResultEntry& entry);

// Index of the first server of the comma-separated list that answers a plain Binding Request
// from localAddress on port 3478, or -1.
int32_t STUN_TestServers(uint32_t localAddress, const char* servers);

// Resolves a server token as GetIPByName does; false when it fails or gives 0. With logErrors,
// an unexpected resolver failure is logged at ERROR under "GetIPByName". hostAddress: host order.
bool ResolveSTUNServer(const char* name, bool logErrors, uint32_t& hostAddress);

}  // namespace stun
