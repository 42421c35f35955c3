// The HRESULT of the calling thread's last error, for the layers that return failures
// instead of ending the process (HTTPS client, UDP test policy, stand-ins). Callable on any
// thread; reads only that thread's last error.
#pragma once

#include <windows.h>

// A call that failed without setting a last error still failed: E_FAIL, never S_OK. A last
// error that already is an HRESULT (the certificate and crypto calls set those) is kept.
inline HRESULT HResultFromLastError()
{
    // Read once: mingw's HRESULT_FROM_WIN32 evaluates its argument more than once.
    const DWORD dwError = GetLastError();
    if (dwError == ERROR_SUCCESS)
    {
        return E_FAIL;
    }
    return HRESULT_FROM_WIN32(dwError);
}
