#include "portmanager/PortManagerUpdateEvent.h"

#include <new>

namespace portmanager {

HRESULT PortManagerUpdateEvent::Create(IPortManagerUpdateEvent** event, ITypeLib* library) {
    if (event == nullptr) {
        return E_POINTER;
    }
    auto* created = new (std::nothrow) PortManagerUpdateEvent();
    if (created == nullptr) {
        *event = nullptr;
        return E_OUTOFMEMORY;
    }
    created->UseTypeLibrary(library);
    created->AddRef();
    *event = created;
    return S_OK;
}

HRESULT PortManagerUpdateEvent::QueryInterface(REFIID riid, void** ppv) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    if (riid == IID_IUnknown || riid == IID_IDispatch || riid == IID_IPortManagerUpdateEvent) {
        *ppv = static_cast<IPortManagerUpdateEvent*>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

ULONG PortManagerUpdateEvent::AddRef() {
    return ++m_refs;
}

ULONG PortManagerUpdateEvent::Release() {
    const ULONG left = --m_refs;
    if (left == 0) {
        delete this;
    }
    return left;
}

HRESULT PortManagerUpdateEvent::get_PortManager(IAdvancedPortManager** pVal) {
    if (pVal == nullptr) {
        return E_POINTER;
    }
    if (!m_portManager) {
        // Only after a client put null on an event it received.
        *pVal = nullptr;
        return E_POINTER;
    }
    return m_portManager->QueryInterface(IID_IAdvancedPortManager, reinterpret_cast<void**>(pVal));
}

HRESULT PortManagerUpdateEvent::put_PortManager(IAdvancedPortManager* newVal) {
    m_portManager.Reset();
    if (newVal == nullptr) {
        return S_OK;
    }
    return newVal->QueryInterface(IID_IUnknown, m_portManager.GetVoidAddressOf());
}

}  // namespace portmanager
