#include "platform/component/cplatformcomponent.h"

#include "platform/component/componentmodule.h"

CPlatformComponent::CPlatformComponent()
    : m_cRef(1)
{
    ComponentModuleAddObject();
}

CPlatformComponent::~CPlatformComponent()
{
    ComponentModuleRemoveObject();
}

HRESULT STDMETHODCALLTYPE CPlatformComponent::QueryInterface(REFIID riid, void **ppv)
{
    if (ppv == nullptr)
    {
        return E_POINTER;
    }
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IPlatformComponent))
    {
        *ppv = static_cast<IPlatformComponent *>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

ULONG STDMETHODCALLTYPE CPlatformComponent::AddRef()
{
    return static_cast<ULONG>(InterlockedIncrement(&m_cRef));
}

ULONG STDMETHODCALLTYPE CPlatformComponent::Release()
{
    LONG cRef = InterlockedDecrement(&m_cRef);
    if (cRef == 0)
    {
        delete this;
    }
    return static_cast<ULONG>(cRef);
}

HRESULT STDMETHODCALLTYPE CPlatformComponent::GetHostProcessId(DWORD *pdwProcessId)
{
    if (pdwProcessId == nullptr)
    {
        return E_POINTER;
    }
    *pdwProcessId = GetCurrentProcessId();
    return S_OK;
}

HRESULT STDMETHODCALLTYPE CPlatformComponent::GetObjectCount(ULONG *pcObjects)
{
    if (pcObjects == nullptr)
    {
        return E_POINTER;
    }
    *pcObjects = ComponentModuleObjectCount();
    return S_OK;
}
