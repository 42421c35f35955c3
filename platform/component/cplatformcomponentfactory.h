// The class object of the component. One static instance per process, never freed: its
// references only pin the DLL through LockServer. Any thread.
#pragma once

#include <windows.h>
#include <unknwn.h>

class CPlatformComponentFactory : public IClassFactory
{
public:
    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void **ppv) override;
    ULONG STDMETHODCALLTYPE AddRef() override;
    ULONG STDMETHODCALLTYPE Release() override;

    HRESULT STDMETHODCALLTYPE CreateInstance(IUnknown *pUnkOuter, REFIID riid, void **ppv) override;
    HRESULT STDMETHODCALLTYPE LockServer(BOOL fLock) override;

    static CPlatformComponentFactory s_factory;
};
