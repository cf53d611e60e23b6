// The object that travels with PME_UPDATED and PME_NETWORK_CHANGE. While it lives, the port
// manager it names stays alive.
#pragma once

#include <atomic>

#include <nqportmanager/ComPtr.h>
#include <nqportmanager/NqPortManager.h>

#include "platform/modulelock.h"
#include "portmanager/Dispatch.h"

namespace portmanager {

class PortManagerUpdateEvent final : public TypeInfoDispatch<IPortManagerUpdateEvent> {
  public:
    // A new event with one reference held by the caller, its IDispatch served from library.
    static HRESULT Create(IPortManagerUpdateEvent** event, ITypeLib* library = nullptr);

    HRESULT QueryInterface(REFIID riid, void** ppv) override;
    ULONG AddRef() override;
    ULONG Release() override;

    HRESULT get_PortManager(IAdvancedPortManager** pVal) override;
    HRESULT put_PortManager(IAdvancedPortManager* newVal) override;

  private:
    PortManagerUpdateEvent() = default;
    ~PortManagerUpdateEvent() = default;

    std::atomic<ULONG> m_refs{0};
    ComPtr<IUnknown> m_portManager;
    platform::ModuleReference m_moduleLock;
};

}  // namespace portmanager
