// The mappings of an enabled profile: the SIP mappings built from the client's addresses, the
// five pools of reserved ports, and the media mappings the client registered for keep-alives.
// Plain records and placeholder sockets, no COM: the port manager converts and logs.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "portmanager/PortMapping.h"
#include "portmanager/PortMappingPool.h"

namespace portmanager {

class ProfileMappings {
  public:
    ProfileMappings() = default;
    ~ProfileMappings() { Close(); }
    ProfileMappings(const ProfileMappings&) = delete;
    ProfileMappings& operator=(const ProfileMappings&) = delete;

    std::vector<PortMapping>& Sip() { return m_sipMappings; }
    const std::vector<PortMapping>& Media() const { return m_mediaMappings; }

    // The spare pool (at least two) and the four media pools of count mappings each, in that
    // order, all from [minPort, maxPort). False at the first pool that cannot be filled.
    bool FillPools(uint32_t count, int32_t minPort, int32_t maxPort,
                   const std::string& privateAddress, const std::string& publicAddress,
                   bool randomize);
    void DumpPools() const;

    // The pool of a media type (AudioRTP to VideoRTCP), or null for any other type.
    PortMappingPool* MediaPool(int32_t type);

    enum class Released { Sip, FromPool, NotInPool };
    // A SIP mapping stays; a media one goes back to the pool that has its port in use. The text
    // of the SIP mapping that matched, for the log, in sipText.
    Released ReleaseToPool(MappedServiceEndpoint& mapping, std::string& sipText);
    // Drops the first registered media mapping with these endpoints; false when there is none.
    bool RemoveMedia(const MappedServiceEndpoint& mapping);
    void AddMedia(const PortMapping& mapping) { m_mediaMappings.push_back(mapping); }

    // The keep-alive tick: the SIP mappings when asked, the media mappings always.
    void Refresh(bool sip) const;
    // Closes every placeholder socket and empties every list.
    void Close();

  private:
    PortMappingPool m_sparePool;
    PortMappingPool m_audioRtpPool;
    PortMappingPool m_audioRtcpPool;
    PortMappingPool m_videoRtpPool;
    PortMappingPool m_videoRtcpPool;
    std::vector<PortMapping> m_mediaMappings;
    std::vector<PortMapping> m_sipMappings;
};

}  // namespace portmanager
