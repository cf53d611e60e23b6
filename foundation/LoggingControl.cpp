#include "foundation/LoggingControl.h"

#include <optional>
#include <string>

#include "foundation/Logger.h"

namespace foundation {

namespace {

HRESULT CopyOut(const std::optional<std::string>& value, BSTR* out) {
    if (out == nullptr) {
        return E_POINTER;
    }
    if (!value.has_value()) {
        *out = nullptr;
        return S_OK;
    }
    BSTR copy = BstrFromUtf8(*value);
    if (copy == nullptr) {
        return E_OUTOFMEMORY;
    }
    *out = copy;
    return S_OK;
}

std::optional<std::string> FromBstr(BSTR text) {
    if (text == nullptr) {
        return std::nullopt;
    }
    return Utf8FromBstr(text);
}

}  // namespace

HRESULT GetLogLevel(INT* pLevel) {
    if (pLevel == nullptr) {
        return E_POINTER;
    }
    *pLevel = Logger().Level();
    return S_OK;
}

HRESULT PutLogLevel(INT level) {
    Logger().SetLevel(level);
    return S_OK;
}

HRESULT GetLogFolder(BSTR* pbstrFolder) {
    return CopyOut(Logger().Folder(), pbstrFolder);
}

HRESULT GetLogFilePrefix(BSTR* pbstrPrefix) {
    return CopyOut(Logger().Prefix(), pbstrPrefix);
}

HRESULT GetLogFileExtension(BSTR* pbstrExtension) {
    return CopyOut(Logger().Extension(), pbstrExtension);
}

HRESULT GetLoggingEnabled(VARIANT_BOOL* pbEnabled) {
    if (pbEnabled == nullptr) {
        return E_POINTER;
    }
    *pbEnabled = Logger().Enabled() ? VARIANT_TRUE : VARIANT_FALSE;
    return S_OK;
}

HRESULT PutLoggingEnabled(VARIANT_BOOL enabled) {
    Logger().SetEnabled(enabled != 0);
    return S_OK;
}

HRESULT InitializeLogging(BSTR bstrFolder, BSTR bstrPrefix, BSTR bstrExt, INT LogLevel,
                          VARIANT_BOOL enabled) {
    const int level =
        LogLevel < kLogError ? kLogError : (LogLevel > kLogTrace ? kLogTrace : LogLevel);
    Logger().Initialize(FromBstr(bstrFolder), FromBstr(bstrPrefix), FromBstr(bstrExt), level,
                        enabled != 0);
    return S_OK;
}

HRESULT ShutdownLogging() {
    Logger().Close();
    return S_OK;
}

}  // namespace foundation
