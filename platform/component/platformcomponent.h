// The platform component the service creates at start: an in-process COM server
// (platformcomponent.dll, ThreadingModel Both) registered machine-wide with regsvr32. The
// phone's component does its own work on the platform once created; this stand-in only
// tells who hosts it, so that a caller can see it runs in-process and is counted.
#pragma once

#include <windows.h>
#include <unknwn.h>

// {B5368813-926B-449C-9676-DB6ED6F8F428}
const CLSID CLSID_PlatformComponent = {
    0xb5368813, 0x926b, 0x449c, {0x96, 0x76, 0xdb, 0x6e, 0xd6, 0xf8, 0xf4, 0x28}};
// {BD38F9C6-BC6C-4381-A13D-5A0D772D121F}
const IID IID_IPlatformComponent = {
    0xbd38f9c6, 0xbc6c, 0x4381, {0xa1, 0x3d, 0x5a, 0x0d, 0x77, 0x2d, 0x12, 0x1f}};

// Free-threaded: every method may be called from any thread of any apartment of the process.
struct IPlatformComponent : public IUnknown
{
    // The process the object lives in.
    virtual HRESULT STDMETHODCALLTYPE GetHostProcessId(DWORD *pdwProcessId) = 0;
    // How many objects of the class live in that process, this one included.
    virtual HRESULT STDMETHODCALLTYPE GetObjectCount(ULONG *pcObjects) = 0;
};
