#include "portmanager/NetworkDiagnosticEvent.h"

#include <new>

#include "portmanager/BstrOut.h"

namespace portmanager {

HRESULT NetworkDiagnosticEvent::Create(const diagnostics::DiagnosticResult& result, LONG cookie,
                                       INetworkDiagnosticEvent** event) {
    if (event == nullptr) {
        return E_POINTER;
    }
    auto* created = new (std::nothrow) NetworkDiagnosticEvent(result, cookie);
    if (created == nullptr) {
        *event = nullptr;
        return E_OUTOFMEMORY;
    }
    created->AddRef();
    *event = created;
    return S_OK;
}

HRESULT NetworkDiagnosticEvent::QueryInterface(REFIID riid, void** ppv) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    if (riid == IID_IUnknown || riid == IID_IDispatch || riid == IID_INetworkDiagnosticEvent) {
        *ppv = static_cast<INetworkDiagnosticEvent*>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

ULONG NetworkDiagnosticEvent::AddRef() {
    return ++m_refs;
}

ULONG NetworkDiagnosticEvent::Release() {
    const ULONG left = --m_refs;
    if (left == 0) {
        delete this;
    }
    return left;
}

HRESULT NetworkDiagnosticEvent::get_errorCode(PM_DIAGNOSTIC_RESULT* pVal) {
    if (pVal == nullptr) {
        return E_POINTER;
    }
    *pVal = static_cast<PM_DIAGNOSTIC_RESULT>(m_result.m_errorCode);
    return S_OK;
}

HRESULT NetworkDiagnosticEvent::get_ErrorText(BSTR* pVal) {
    return CopyBstrOut(diagnostics::ErrorText(m_result.m_errorCode), pVal);
}

HRESULT NetworkDiagnosticEvent::get_TestType(PM_DIAGNOSTIC_TEST_TYPE* pVal) {
    if (pVal == nullptr) {
        return E_POINTER;
    }
    *pVal = static_cast<PM_DIAGNOSTIC_TEST_TYPE>(m_result.m_testType);
    return S_OK;
}

HRESULT NetworkDiagnosticEvent::get_TestTypeText(BSTR* pVal) {
    return CopyBstrOut(diagnostics::TestTypeText(m_result.m_testType), pVal);
}

HRESULT NetworkDiagnosticEvent::get_AdditionalInfo(BSTR* pVal) {
    return CopyBstrOut(m_result.m_additionalInfo, pVal);
}

HRESULT NetworkDiagnosticEvent::get_cookie(LONG* pVal) {
    if (pVal == nullptr) {
        return E_POINTER;
    }
    *pVal = m_cookie;
    return S_OK;
}

}  // namespace portmanager
