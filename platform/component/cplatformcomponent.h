// The component object. Free-threaded (any thread, any apartment); owned by its COM
// references, and it keeps the DLL loaded while it lives.
#pragma once

#include "platform/component/platformcomponent.h"

class CPlatformComponent : public IPlatformComponent
{
public:
    CPlatformComponent();

    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void **ppv) override;
    ULONG STDMETHODCALLTYPE AddRef() override;
    ULONG STDMETHODCALLTYPE Release() override;

    HRESULT STDMETHODCALLTYPE GetHostProcessId(DWORD *pdwProcessId) override;
    HRESULT STDMETHODCALLTYPE GetObjectCount(ULONG *pcObjects) override;

private:
    virtual ~CPlatformComponent();

    volatile LONG m_cRef;
};
