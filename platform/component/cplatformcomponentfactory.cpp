#include "platform/component/cplatformcomponentfactory.h"

#include "platform/component/componentmodule.h"
#include "platform/component/cplatformcomponent.h"

#include <new>

CPlatformComponentFactory CPlatformComponentFactory::s_factory;

HRESULT STDMETHODCALLTYPE CPlatformComponentFactory::QueryInterface(REFIID riid, void **ppv)
{
    if (ppv == nullptr)
    {
        return E_POINTER;
    }
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IClassFactory))
    {
        *ppv = static_cast<IClassFactory *>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

// A static object: the count would mean nothing. What keeps the DLL in memory for a caller
// that holds the factory is LockServer, as COM expects.
ULONG STDMETHODCALLTYPE CPlatformComponentFactory::AddRef()
{
    return 2;
}

ULONG STDMETHODCALLTYPE CPlatformComponentFactory::Release()
{
    return 1;
}

HRESULT STDMETHODCALLTYPE CPlatformComponentFactory::CreateInstance(IUnknown *pUnkOuter,
                                                                    REFIID riid, void **ppv)
{
    if (ppv == nullptr)
    {
        return E_POINTER;
    }
    *ppv = nullptr;
    if (pUnkOuter != nullptr)
    {
        return CLASS_E_NOAGGREGATION;
    }
    CPlatformComponent *pComponent = new (std::nothrow) CPlatformComponent();
    if (pComponent == nullptr)
    {
        return E_OUTOFMEMORY;
    }
    HRESULT hr = pComponent->QueryInterface(riid, ppv);
    pComponent->Release();
    return hr;
}

HRESULT STDMETHODCALLTYPE CPlatformComponentFactory::LockServer(BOOL fLock)
{
    ComponentModuleLock(fLock);
    return S_OK;
}
