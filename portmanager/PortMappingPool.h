// Ports of one parity reserved by placeholder sockets, handed out one at a time.
#pragma once

#include <cstdint>
#include <deque>
#include <string>

#include "portmanager/PortMapping.h"

namespace portmanager {

class PortMappingPool {
  public:
    PortMappingPool() = default;
    ~PortMappingPool() = default;  // the owner closes the free list explicitly (CloseFree)
    PortMappingPool(const PortMappingPool&) = delete;
    PortMappingPool& operator=(const PortMappingPool&) = delete;

    // Replaces the free list with mappings of the parity from [minPort, maxPort): first up to 100
    // random candidates when randomize, then an ascending scan. True as soon as the free list
    // holds count mappings (tested after each addition); false when the ports run out, keeping
    // what was found. Candidates outside 1..65535 are skipped without a bind: they can never be
    // held as themselves.
    bool Fill(bool even, uint32_t count, int32_t minPort, int32_t maxPort,
              const std::string& privateAddress, const std::string& publicAddress, bool randomize);
    // Hands out the front of the free list, its port released for the client to bind. False
    // when the free list is empty.
    bool GetMapping(MappedServiceEndpoint& mapping);
    // Takes a mapping back: out of the in-use list, re-bound, to the front of the free list.
    void ReleaseMapping(MappedServiceEndpoint& mapping);
    // Closes every placeholder socket of the free list and empties it.
    void CloseFree();
    bool IsInUse(int32_t privatePort) const;

    const std::deque<MappedServiceEndpoint>& Free() const { return m_free; }
    const std::deque<MappedServiceEndpoint>& InUse() const { return m_inUse; }

  private:
    bool TryAdd(int32_t port, const std::string& privateAddress, const std::string& publicAddress);

    std::deque<MappedServiceEndpoint> m_inUse;
    std::deque<MappedServiceEndpoint> m_free;
};

}  // namespace portmanager
