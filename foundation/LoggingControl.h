// The client's control of the process-wide logger: the operations of INqDiagnostics, which the
// port manager delegates to, so that every object in the process shares one configuration.
#pragma once

#include <nqportmanager/com.h>

namespace foundation {

HRESULT GetLogLevel(INT* pLevel);
// Stored as given, without clamping.
HRESULT PutLogLevel(INT level);
// A null BSTR when never set. E_OUTOFMEMORY when the copy cannot be made.
HRESULT GetLogFolder(BSTR* pbstrFolder);
HRESULT GetLogFilePrefix(BSTR* pbstrPrefix);
HRESULT GetLogFileExtension(BSTR* pbstrExtension);
HRESULT GetLoggingEnabled(VARIANT_BOOL* pbEnabled);
HRESULT PutLoggingEnabled(VARIANT_BOOL enabled);
// Clamps LogLevel to 0..4. A null string leaves that part absent.
HRESULT InitializeLogging(BSTR bstrFolder, BSTR bstrPrefix, BSTR bstrExt, INT LogLevel,
                          VARIANT_BOOL enabled);
HRESULT ShutdownLogging();

}  // namespace foundation
