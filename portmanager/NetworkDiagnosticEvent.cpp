#include "portmanager/NetworkDiagnosticEvent.h"

#include <iterator>
#include <new>

#include "portmanager/BstrOut.h"

namespace portmanager {

HRESULT NetworkDiagnosticEvent::Create(const diagnostics::DiagnosticResult& result, LONG cookie,
                                       INetworkDiagnosticEvent** event, ITypeLib* library) {
    if (event == nullptr) {
        return E_POINTER;
    }
    auto* created = new (std::nothrow) NetworkDiagnosticEvent(result, cookie);
    if (created == nullptr) {
        *event = nullptr;
        return E_OUTOFMEMORY;
    }
    created->UseTypeLibrary(library);
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
    if (riid == IID_INetworkDiagnosticTests) {
        *ppv = static_cast<INetworkDiagnosticTests*>(this);
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

HRESULT NetworkDiagnosticEvent::get_TestCount(LONG* pVal) {
    if (pVal == nullptr) {
        return E_POINTER;
    }
    *pVal = static_cast<LONG>(m_result.m_tests.size());
    return S_OK;
}

HRESULT NetworkDiagnosticEvent::GetTest(LONG index, PM_DIAGNOSTIC_TEST_TYPE* type, BSTR* typeText,
                                        PM_DIAGNOSTIC_RESULT* errorCode, BSTR* errorText,
                                        BSTR* additionalInfo) {
    if (type == nullptr || typeText == nullptr || errorCode == nullptr || errorText == nullptr ||
        additionalInfo == nullptr) {
        return E_POINTER;
    }
    if (index < 0 || static_cast<size_t>(index) >= m_result.m_tests.size()) {
        return E_INVALIDARG;
    }
    const auto& record = std::next(m_result.m_tests.begin(), index)->second;
    BStr texts[3];
    HRESULT hr = CopyBstrOut(diagnostics::TestTypeText(record.m_testType), texts[0].Out());
    if (SUCCEEDED(hr)) {
        hr = CopyBstrOut(diagnostics::ErrorText(record.m_errorCode), texts[1].Out());
    }
    if (SUCCEEDED(hr)) {
        hr = CopyBstrOut(record.m_additionalInfo, texts[2].Out());
    }
    if (FAILED(hr)) {
        return hr;
    }
    *type = static_cast<PM_DIAGNOSTIC_TEST_TYPE>(record.m_testType);
    *errorCode = static_cast<PM_DIAGNOSTIC_RESULT>(record.m_errorCode);
    *typeText = texts[0].Detach();
    *errorText = texts[1].Detach();
    *additionalInfo = texts[2].Detach();
    return S_OK;
}

}  // namespace portmanager
