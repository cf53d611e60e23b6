// The port manager's side of the network diagnostics: starting runs, and turning each posted
// result into PME_DIAGNOSTIC_COMPLETED for the sinks.
#include "foundation/Logger.h"
#include "portmanager/AdvancedPortManager.h"
#include "portmanager/NetworkDiagnosticEvent.h"

namespace portmanager {

HRESULT CAdvancedPortManager::DiagnoseNetwork(BSTR bstrWellKnownNetworkAddress, BSTR bstrStunServer,
                                              BSTR bstrEchoServer, INT nEchoServerPort,
                                              LONG timeout, LONG cookie) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::DiagnoseNetwork");
    if (bstrWellKnownNetworkAddress == nullptr || bstrStunServer == nullptr ||
        bstrEchoServer == nullptr) {
        return E_POINTER;
    }
    if (nEchoServerPort < 1 || nEchoServerPort > 65534 || timeout < 0) {
        return E_INVALIDARG;
    }
    diagnostics::DiagnosticRequest request;
    request.m_window = Handle();
    request.m_message = WM_PM_DIAGNOSTIC_COMPLETE;
    request.m_cookie = cookie;
    request.m_wellKnownNetworkAddress = Utf8FromBstr(bstrWellKnownNetworkAddress);
    request.m_stunServer = Utf8FromBstr(bstrStunServer);
    request.m_echoServer = Utf8FromBstr(bstrEchoServer);
    request.m_echoServerPort = static_cast<uint16_t>(nEchoServerPort);
    request.m_timeout = static_cast<uint32_t>(timeout);
    diagnostics::DiagnosticServices services;
    services.networkInfo = m_services.networkInfo;
    services.routeLookup = m_services.routeLookup;
    const int error = m_diagnosticRuns.Start(std::move(request), services);
    if (error == 0) {
        return S_OK;
    }
    return error > 0 ? static_cast<HRESULT>(0x80070000u | (static_cast<uint32_t>(error) & 0xFFFFu))
                     : static_cast<HRESULT>(error);
}

void CAdvancedPortManager::OnDiagnosticComplete(platform::WPARAM wParam) {
    const std::unique_ptr<diagnostics::DiagnosticOutcome> outcome =
        m_diagnosticRuns.TakePosted(wParam);
    if (!outcome) {
        return;  // not an outcome of ours
    }
    ComPtr<INetworkDiagnosticEvent> event;
    ComPtr<IDispatch> dispatch;
    if (FAILED(NetworkDiagnosticEvent::Create(outcome->m_result, outcome->m_cookie,
                                              event.GetAddressOf(), m_services.typeLibrary)) ||
        FAILED(event.As(&dispatch))) {
        return;
    }
    m_events.Fire([&](_IAdvancedPortManagerEvents* sink) {
        sink->Event(PME_DIAGNOSTIC_COMPLETED, dispatch.Get());
    });
}

}  // namespace portmanager
