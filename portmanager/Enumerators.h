// Snapshot enumerators for the connection-point interfaces: IEnumConnections over the sinks of a
// point, IEnumConnectionPoints over the points of a container. Each holds its own references, so
// that connecting or releasing during an enumeration cannot invalidate it.
#pragma once

#include <algorithm>
#include <atomic>
#include <memory>
#include <new>
#include <utility>
#include <vector>

#include <nqportmanager/ComPtr.h>
#include <nqportmanager/NqPortManager.h>

#include "platform/modulelock.h"

namespace portmanager {

struct ConnectionEntry {
    ComPtr<IUnknown> sink;
    DWORD cookie = 0;
};

// The element handed out, with a reference of its own for the caller.
inline CONNECTDATA HandOut(const ConnectionEntry& e) {
    ComPtr<IUnknown> copy = e.sink;
    return {copy.Detach(), e.cookie};
}
inline IConnectionPoint* HandOut(const ComPtr<IConnectionPoint>& point) {
    return ComPtr<IConnectionPoint>(point).Detach();
}

template <typename IEnum, typename Out, typename Entry>
class SnapshotEnum final : public IEnum {
  public:
    static HRESULT Create(std::vector<Entry> entries, IEnum** out) {
        if (out == nullptr) {
            return E_POINTER;
        }
        *out = nullptr;
        std::shared_ptr<const std::vector<Entry>> shared;
        try {
            shared = std::make_shared<const std::vector<Entry>>(std::move(entries));
        } catch (const std::bad_alloc&) {
            return E_OUTOFMEMORY;
        }
        return Make(std::move(shared), 0, out);
    }

    HRESULT QueryInterface(REFIID riid, void** ppv) override {
        if (ppv == nullptr) {
            return E_POINTER;
        }
        if (riid != IID_IUnknown && riid != *ComIidOf<IEnum>) {
            *ppv = nullptr;
            return E_NOINTERFACE;
        }
        *ppv = static_cast<IEnum*>(this);
        AddRef();
        return S_OK;
    }
    ULONG AddRef() override { return ++m_refs; }
    ULONG Release() override {
        const ULONG left = --m_refs;
        if (left == 0) {
            delete this;
        }
        return left;
    }

    // S_FALSE when fewer than asked were left; fetched may be null only when one is asked.
    HRESULT Next(ULONG count, Out* out, ULONG* fetched) override {
        if (out == nullptr || (fetched == nullptr && count != 1)) {
            return E_POINTER;
        }
        ULONG n = 0;
        for (; n < count && m_next < m_entries->size(); ++n) {
            out[n] = HandOut((*m_entries)[m_next++]);
        }
        if (fetched != nullptr) {
            *fetched = n;
        }
        return n == count ? S_OK : S_FALSE;
    }
    HRESULT Skip(ULONG count) override {
        const size_t left = m_entries->size() - m_next;
        m_next += std::min<size_t>(count, left);
        return count <= left ? S_OK : S_FALSE;
    }
    HRESULT Reset() override {
        m_next = 0;
        return S_OK;
    }
    HRESULT Clone(IEnum** out) override {
        if (out == nullptr) {
            return E_POINTER;
        }
        return Make(m_entries, m_next, out);
    }

  private:
    SnapshotEnum(std::shared_ptr<const std::vector<Entry>> entries, size_t next)
        : m_entries(std::move(entries)), m_next(next) {}
    ~SnapshotEnum() = default;

    static HRESULT Make(std::shared_ptr<const std::vector<Entry>> entries, size_t next,
                        IEnum** out) {
        auto* e = new (std::nothrow) SnapshotEnum(std::move(entries), next);
        if (e == nullptr) {
            *out = nullptr;
            return E_OUTOFMEMORY;
        }
        e->AddRef();
        *out = e;
        return S_OK;
    }

    std::atomic<ULONG> m_refs{0};
    std::shared_ptr<const std::vector<Entry>> m_entries;
    size_t m_next;
    platform::ModuleReference m_lock;
};

using ConnectionsEnum = SnapshotEnum<IEnumConnections, CONNECTDATA, ConnectionEntry>;
using ConnectionPointsEnum =
    SnapshotEnum<IEnumConnectionPoints, LPCONNECTIONPOINT, ComPtr<IConnectionPoint>>;

}  // namespace portmanager
