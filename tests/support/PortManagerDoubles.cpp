#include "tests/support/PortManagerDoubles.h"

namespace testsupport {

HRESULT RecordingSink::QueryInterface(REFIID riid, void** ppv) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    *ppv = nullptr;
    if (riid == IID_IUnknown) {
        *ppv = static_cast<IUnknown*>(this);
    } else if (riid == DIID__IAdvancedPortManagerEvents) {
        if (answerEventQueries == 0) {
            return E_NOINTERFACE;
        }
        if (answerEventQueries > 0) {
            --answerEventQueries;
        }
        *ppv = static_cast<_IAdvancedPortManagerEvents*>(this);
    } else {
        return E_NOINTERFACE;
    }
    AddRef();
    return S_OK;
}

HRESULT RecordingSink::Event(PM_EVENT type, IDispatch* event) {
    Received r{type, nullptr, PMS_UNINITIALIZED};
    ComPtr<IPortManagerUpdateEvent> update;
    ComPtr<IAdvancedPortManager> pm;
    if (event != nullptr &&
        SUCCEEDED(event->QueryInterface(IID_IPortManagerUpdateEvent, update.GetVoidAddressOf())) &&
        SUCCEEDED(update->get_PortManager(pm.GetAddressOf())) && pm) {
        r.portManager = pm.Get();
        pm->get_State(&r.state);
    }
    received.push_back(r);
    if (order != nullptr) {
        order->push_back(this);
    }
    if (onEvent) {
        onEvent(type);
    }
    return S_OK;
}

HRESULT FakeStunService::Refresh() {
    running = true;
    ++refreshes;
    if (postOnRefresh) {
        platform::PostMessage(m_window, m_message, m_wParam, 0);
    }
    return S_OK;
}

bool FakeStunService::GetSTUNResult(stun::STUNResultList* result) {
    if (result == nullptr || !ready) {
        return false;
    }
    *result = list;
    return true;
}

portmanager::PortManagerServices ServicesWith(platform::NetworkInfo& net,
                                              platform::UpnpGatewayProbe* upnp) {
    portmanager::PortManagerServices services;
    services.networkInfo = &net;
    if (upnp != nullptr) {
        services.upnpProbe = upnp;
    }
    return services;
}

PortManagerWithFakeStun::PortManagerWithFakeStun(portmanager::PortManagerServices services) {
    services.createStunService = [this](const char*, platform::WindowHandle window,
                                        platform::UINT message, platform::WPARAM wParam,
                                        platform::NetworkInfo&) {
        auto service = std::make_unique<FakeStunService>(window, message, wParam);
        service->list = nextList;
        service->ready = nextReady;
        stun = service.get();
        return std::unique_ptr<stun::ISTUNResult>(std::move(service));
    };
    portmanager::CAdvancedPortManager::CreateInstance(IID_IAdvancedPortManager,
                                                      pm.GetVoidAddressOf(), std::move(services));
}

DWORD PortManagerWithFakeStun::Connect(RecordingSink& sink) {
    ComPtr<IConnectionPointContainer> container;
    ComPtr<IConnectionPoint> point;
    DWORD cookie = 0;
    if (SUCCEEDED(
            pm->QueryInterface(IID_IConnectionPointContainer, container.GetVoidAddressOf())) &&
        SUCCEEDED(container->FindConnectionPoint(DIID__IAdvancedPortManagerEvents,
                                                 point.GetAddressOf()))) {
        point->Advise(&sink, &cookie);
    }
    return cookie;
}

HRESULT PortManagerWithFakeStun::Initialize(bool upnp, bool stunEnabled, const char* sipProxy,
                                            const char* mediaProxy) {
    BStr server("stun.example.net");
    BStr sip(sipProxy);
    BStr media(mediaProxy);
    return pm->InitializeEx2(server.Get(), 5004, 16, sip.Get(), media.Get(),
                             upnp ? VARIANT_FALSE : VARIANT_TRUE,
                             stunEnabled ? VARIANT_FALSE : VARIANT_TRUE, 30000, VARIANT_TRUE,
                             VARIANT_TRUE, VARIANT_TRUE);
}

std::string ToUtf8(BSTR text) {
    std::string s = Utf8FromBstr(text);
    SysFreeString(text);
    return s;
}

}  // namespace testsupport
