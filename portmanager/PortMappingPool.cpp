#include "portmanager/PortMappingPool.h"

#include <algorithm>
#include <cstdlib>

#include "foundation/Logger.h"

namespace portmanager {

namespace {

constexpr int kRandomAttempts = 100;
// The only ports a placeholder can hold as themselves: 0 would bind an arbitrary port and
// anything outside 16 bits does not exist, so candidates there are skipped without a bind.
constexpr int64_t kLowestPort = 1;
constexpr int64_t kHighestPort = 0xFFFF;

bool HasParity(int64_t port, bool even) {
    return ((port & 1) == 0) == even;
}

}  // namespace

bool PortMappingPool::Fill(bool even, uint32_t count, int32_t minPort, int32_t maxPort,
                           const std::string& privateAddress, const std::string& publicAddress,
                           bool randomize) {
    CloseFree();
    // 64-bit arithmetic: the bounds come from the client and maxPort - minPort may not fit.
    const int64_t low = minPort;
    const int64_t high = maxPort;

    if (randomize && high > low) {
        for (int attempt = 0; attempt < kRandomAttempts; ++attempt) {
            // rand() % 32768 keeps the spread of a 15-bit generator (candidates at most 32767
            // above minPort) on runtimes whose rand() goes up to 2^31 - 1.
            const int64_t candidate = low + (std::rand() % 32768) % (high - low);
            if (!HasParity(candidate, even)) {
                continue;
            }
            if (TryAdd(static_cast<int32_t>(candidate), privateAddress, publicAddress) &&
                m_free.size() >= count) {
                return true;
            }
        }
    }

    // Ports outside 1..65535 can never be held, so the scan covers only the part of the range
    // that can bind; a range of billions ends as fast as one of 65535 ports.
    const int64_t first = std::max(low, kLowestPort);
    const int64_t end = std::min(high, kHighestPort + 1);
    for (int64_t port = first; port < end; ++port) {
        if (!HasParity(port, even)) {
            continue;
        }
        if (TryAdd(static_cast<int32_t>(port), privateAddress, publicAddress) &&
            m_free.size() >= count) {
            return true;
        }
    }
    return false;
}

bool PortMappingPool::TryAdd(int32_t port, const std::string& privateAddress,
                             const std::string& publicAddress) {
    if (port < kLowestPort || port > kHighestPort) {
        return false;
    }
    MappedServiceEndpoint mapping({privateAddress, port}, {publicAddress, port});
    if (!mapping.Open(false)) {
        return false;
    }
    m_free.push_back(std::move(mapping));
    return true;
}

bool PortMappingPool::GetMapping(MappedServiceEndpoint& mapping) {
    if (m_free.empty()) {
        return false;
    }
    MappedServiceEndpoint taken = m_free.front();
    m_free.pop_front();
    // From now on the port is the client's to bind.
    taken.Close();
    if (foundation::Logger().IsEnabledFor(foundation::kLogInfo)) {
        NQ_LOG("PortMappingPool::GetMapping", foundation::kLogInfo, "%s", taken.ToString().c_str());
    }
    m_inUse.push_back(taken);
    mapping = std::move(taken);
    return true;
}

void PortMappingPool::ReleaseMapping(MappedServiceEndpoint& mapping) {
    constexpr const char* kFunction = "PortMappingPool::ReleaseMapping";
    if (foundation::Logger().IsEnabledFor(foundation::kLogInfo)) {
        NQ_LOG(kFunction, foundation::kLogInfo, "MappedServiceEndpoint is Media - %s",
               mapping.ToString().c_str());
    }
    const auto found =
        std::find_if(m_inUse.begin(), m_inUse.end(), [&](const MappedServiceEndpoint& m) {
            return m.m_private.m_port == mapping.m_private.m_port;
        });
    if (found != m_inUse.end()) {
        m_inUse.erase(found);
    } else {
        NQ_LOG(kFunction, foundation::kLogError, "%s", "Failed Assertion - found");
    }
    // A failed re-bind still returns the mapping, without a placeholder (m_socket invalid).
    mapping.Open(false);
    m_free.push_front(mapping);
}

void PortMappingPool::CloseFree() {
    for (MappedServiceEndpoint& mapping : m_free) {
        mapping.Close();
    }
    m_free.clear();
}

bool PortMappingPool::IsInUse(int32_t privatePort) const {
    return std::any_of(m_inUse.begin(), m_inUse.end(), [&](const MappedServiceEndpoint& m) {
        return m.m_private.m_port == privatePort;
    });
}

}  // namespace portmanager
