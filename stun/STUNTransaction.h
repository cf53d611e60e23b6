// The two classic STUN transactions the classification and the diagnostics are built from. Each
// sends from sockets of its own, retransmits on a doubling wait and accepts the first response
// carrying the request's transaction id. Both block the calling thread (up to 4.7 s and 9.5 s) and
// end early, returning false, when the thread's owner asks it to stop.
#pragma once

#include <cstdint>

#include "stun/STUNMessage.h"

namespace stun {

// A Binding Request from localAddress (host order, 0 for any) to the server, with CHANGE-REQUEST
// when a change flag is set. localPort: null takes a rotating port, a pointer to 0 takes a
// rotating port and receives it, any other value binds exactly that port. On true, response holds
// the accepted answer; fromAddress/fromPort hold the sender of the last datagram received.
bool STUN_RunTest(uint32_t localAddress, uint16_t* localPort, uint32_t serverAddress,
                  uint16_t serverPort, bool changeIp, bool changePort, CSTUNMessage& response,
                  uint32_t& fromAddress, uint16_t& fromPort);

// Asks the server (change IP and port) to answer to a second local socket that has sent nothing,
// at responseAddress. True when the answer arrives there from an address and a port that both
// differ from the server's.
bool STUN_RunResponseAddressTest(uint32_t localAddress, uint32_t serverAddress, uint16_t serverPort,
                                 uint32_t responseAddress);

}  // namespace stun
