#include "portmanager/ProfileMappings.h"

#include <nqportmanager/NqPortManager.h>

namespace portmanager {

namespace {
bool SameEndpoints(const MappedServiceEndpoint& a, const MappedServiceEndpoint& b) {
    return a.m_public == b.m_public && a.m_private == b.m_private;
}
}  // namespace

bool ProfileMappings::FillPools(uint32_t count, int32_t minPort, int32_t maxPort,
                                const std::string& p, const std::string& q, bool randomize) {
    return m_sparePool.Fill(true, count <= 1 ? 2 : count, minPort, maxPort, p, q, randomize) &&
           m_audioRtpPool.Fill(true, count, minPort, maxPort, p, q, randomize) &&
           m_audioRtcpPool.Fill(false, count, minPort, maxPort, p, q, randomize) &&
           m_videoRtpPool.Fill(true, count, minPort, maxPort, p, q, randomize) &&
           m_videoRtcpPool.Fill(false, count, minPort, maxPort, p, q, randomize);
}

void ProfileMappings::DumpPools() const {
    DumpPortMappings("AudioRTP", m_audioRtpPool);
    DumpPortMappings("AudioRTCP", m_audioRtcpPool);
    DumpPortMappings("VideoRTP", m_videoRtpPool);
    DumpPortMappings("VideoRTCP", m_videoRtcpPool);
}

PortMappingPool* ProfileMappings::MediaPool(int32_t type) {
    switch (type) {
        case AudioRTP:
            return &m_audioRtpPool;
        case AudioRTCP:
            return &m_audioRtcpPool;
        case VideoRTP:
            return &m_videoRtpPool;
        case VideoRTCP:
            return &m_videoRtcpPool;
        default:
            return nullptr;
    }
}

ProfileMappings::Released ProfileMappings::ReleaseToPool(MappedServiceEndpoint& mapping,
                                                         std::string& sipText) {
    for (const PortMapping& sip : m_sipMappings) {
        if (SameEndpoints(sip.m_local, mapping)) {
            // SIP mappings live until the next enable.
            sipText = sip.ToString();
            return Released::Sip;
        }
    }
    for (PortMappingPool* pool :
         {&m_audioRtpPool, &m_audioRtcpPool, &m_videoRtpPool, &m_videoRtcpPool}) {
        if (pool->IsInUse(mapping.m_private.m_port)) {
            pool->ReleaseMapping(mapping);
            return Released::FromPool;
        }
    }
    return Released::NotInPool;
}

bool ProfileMappings::RemoveMedia(const MappedServiceEndpoint& mapping) {
    for (auto it = m_mediaMappings.begin(); it != m_mediaMappings.end(); ++it) {
        if (SameEndpoints(it->m_local, mapping)) {
            m_mediaMappings.erase(it);
            return true;
        }
    }
    return false;
}

void ProfileMappings::Refresh(bool sip) const {
    if (sip) {
        RefreshPortMappings(m_sipMappings);
    }
    RefreshPortMappings(m_mediaMappings);
}

void ProfileMappings::Close() {
    for (PortMappingPool* pool :
         {&m_sparePool, &m_audioRtpPool, &m_audioRtcpPool, &m_videoRtpPool, &m_videoRtcpPool}) {
        pool->CloseFree();
    }
    m_sipMappings.clear();
    m_mediaMappings.clear();
}

}  // namespace portmanager
