#include "foundation/NetworkEndpoint.h"

namespace foundation {

std::string NetworkEndpoint::ToString() const {
    return "m_address= " + m_address + ", m_port=" + std::to_string(m_port);
}

}  // namespace foundation
