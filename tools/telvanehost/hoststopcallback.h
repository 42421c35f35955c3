// The service host's stop-callback registration, the RegisterStopCallback of the global
// data block a host hands to its service DLLs.
#pragma once

#include <windows.h>

// A one-shot thread-pool wait on hObject that calls pfnCallback(pvContext, FALSE) once. The
// wait handle goes to *phNewWaitObject for the callback to unregister, so the service
// signals hObject only after this returns. Returns 0 or the error of the registration.
DWORD WINAPI HostRegisterStopCallback(PHANDLE phNewWaitObject, PCWSTR wszServiceName,
                                      HANDLE hObject, WAITORTIMERCALLBACK pfnCallback,
                                      PVOID pvContext, DWORD dwFlags);

// Waits at most dwTimeoutMs until no stop callback is running; true when none is. A host
// calls it before unloading its DLLs: a service reports STOPPED from inside its callback,
// so the dispatcher may return while the callback still runs code of the DLL.
bool HostWaitForStopCallbacks(DWORD dwTimeoutMs);
