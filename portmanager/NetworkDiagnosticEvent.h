// The object that travels with PME_DIAGNOSTIC_COMPLETED: the outcome of one diagnostic run and
// the cookie its caller gave.
#pragma once

#include <atomic>

#include <nqportmanager/NqPortManager.h>

#include "diagnostics/DiagnosticResult.h"
#include "platform/modulelock.h"
#include "portmanager/Dispatch.h"

namespace portmanager {

class NetworkDiagnosticEvent final : public TypeInfoDispatch<INetworkDiagnosticEvent>,
                                     public INetworkDiagnosticTests {
  public:
    // A new event holding a copy of result, with one reference held by the caller, its IDispatch
    // served from library.
    static HRESULT Create(const diagnostics::DiagnosticResult& result, LONG cookie,
                          INetworkDiagnosticEvent** event, ITypeLib* library = nullptr);

    HRESULT QueryInterface(REFIID riid, void** ppv) override;
    ULONG AddRef() override;
    ULONG Release() override;

    HRESULT get_errorCode(PM_DIAGNOSTIC_RESULT* pVal) override;
    HRESULT get_ErrorText(BSTR* pVal) override;
    HRESULT get_TestType(PM_DIAGNOSTIC_TEST_TYPE* pVal) override;
    HRESULT get_TestTypeText(BSTR* pVal) override;
    HRESULT get_AdditionalInfo(BSTR* pVal) override;
    HRESULT get_cookie(LONG* pVal) override;

    HRESULT get_TestCount(LONG* pVal) override;
    HRESULT GetTest(LONG index, PM_DIAGNOSTIC_TEST_TYPE* type, BSTR* typeText,
                    PM_DIAGNOSTIC_RESULT* errorCode, BSTR* errorText,
                    BSTR* additionalInfo) override;

    const diagnostics::DiagnosticResult& Result() const { return m_result; }

  private:
    NetworkDiagnosticEvent(const diagnostics::DiagnosticResult& result, LONG cookie)
        : m_result(result), m_cookie(cookie) {}
    ~NetworkDiagnosticEvent() = default;

    std::atomic<ULONG> m_refs{0};
    platform::ModuleReference m_moduleLock;
    diagnostics::DiagnosticResult m_result;
    LONG m_cookie;
};

}  // namespace portmanager
