// The sinks connected to one connection point: a growable array whose 1-based slot is the
// cookie. Firing calls every sink that answers the event interface, in slot order, synchronously.
// Any object with an outgoing interface owns one per interface and routes IConnectionPoint to it.
#pragma once

#include <new>
#include <utility>
#include <vector>

#include <nqportmanager/ComPtr.h>
#include <nqportmanager/NqPortManager.h>

#include "portmanager/Enumerators.h"

namespace portmanager {

template <typename Events>
class ConnectionPoint {
  public:
    // The id stays owned by the caller (an interface id constant).
    explicit ConnectionPoint(const IID& eventsIid) : m_iid(eventsIid) {}
    ConnectionPoint(const ConnectionPoint&) = delete;
    ConnectionPoint& operator=(const ConnectionPoint&) = delete;

    const IID& EventsIid() const { return m_iid; }

    // Keeps the sink's event interface. A sink without it gives CONNECT_E_CANNOTCONNECT; a
    // failure to store it, CONNECT_E_ADVISELIMIT.
    HRESULT Advise(IUnknown* sink, DWORD* cookie) {
        if (sink == nullptr || cookie == nullptr) {
            return E_POINTER;
        }
        *cookie = 0;
        ComPtr<IUnknown> events;
        if (FAILED(sink->QueryInterface(m_iid, events.GetVoidAddressOf())) || !events) {
            return CONNECT_E_CANNOTCONNECT;
        }
        for (size_t i = 0; i < m_slots.size(); ++i) {
            if (!m_slots[i]) {
                m_slots[i] = std::move(events);
                *cookie = static_cast<DWORD>(i + 1);
                return S_OK;
            }
        }
        try {
            m_slots.push_back(std::move(events));
        } catch (const std::bad_alloc&) {
            return CONNECT_E_ADVISELIMIT;
        }
        *cookie = static_cast<DWORD>(m_slots.size());
        return S_OK;
    }

    // CONNECT_E_NOCONNECTION for a cookie that names no live sink.
    HRESULT Unadvise(DWORD cookie) {
        if (cookie == 0 || cookie > m_slots.size() || !m_slots[cookie - 1]) {
            return CONNECT_E_NOCONNECTION;
        }
        // Moved out first: the sink's release may call back into this point.
        ComPtr<IUnknown> gone = std::move(m_slots[cookie - 1]);
        return S_OK;
    }

    // An enumerator over the live connections, in cookie order.
    HRESULT EnumConnections(IEnumConnections** out) const {
        std::vector<ConnectionEntry> live;
        try {
            for (size_t i = 0; i < m_slots.size(); ++i) {
                if (m_slots[i]) {
                    live.push_back({m_slots[i], static_cast<DWORD>(i + 1)});
                }
            }
        } catch (const std::bad_alloc&) {
            return E_OUTOFMEMORY;
        }
        return ConnectionsEnum::Create(std::move(live), out);
    }

    // call(Events*) for every sink, in slot order. Sinks that connect meanwhile beyond the slots
    // present at the start are not called.
    template <typename Call>
    void Fire(Call&& call) {
        const size_t n = m_slots.size();
        for (size_t i = 0; i < n; ++i) {
            // A sink may connect or disconnect others from inside its call: re-read every slot.
            if (i >= m_slots.size() || !m_slots[i]) {
                continue;
            }
            const ComPtr<IUnknown> sink = m_slots[i];
            ComPtr<Events> events;
            if (SUCCEEDED(sink->QueryInterface(m_iid, events.GetVoidAddressOf())) && events) {
                call(events.Get());
            }
        }
    }

  private:
    const IID& m_iid;
    std::vector<ComPtr<IUnknown>> m_slots;  // empty where a sink disconnected
};

}  // namespace portmanager
