#include "platform/component/componentmodule.h"

namespace
{
HMODULE s_hModule = nullptr;
volatile LONG s_cObjects = 0;
volatile LONG s_cLocks = 0;
} // namespace

HMODULE ComponentModuleHandle()
{
    return s_hModule;
}

void ComponentModuleSetHandle(HMODULE hModule)
{
    s_hModule = hModule;
}

ULONG ComponentModuleObjectCount()
{
    return static_cast<ULONG>(InterlockedCompareExchange(&s_cObjects, 0, 0));
}

void ComponentModuleAddObject()
{
    InterlockedIncrement(&s_cObjects);
}

void ComponentModuleRemoveObject()
{
    InterlockedDecrement(&s_cObjects);
}

void ComponentModuleLock(BOOL fLock)
{
    if (fLock)
    {
        InterlockedIncrement(&s_cLocks);
    }
    else
    {
        InterlockedDecrement(&s_cLocks);
    }
}

bool ComponentModuleCanUnload()
{
    return InterlockedCompareExchange(&s_cObjects, 0, 0) == 0 &&
           InterlockedCompareExchange(&s_cLocks, 0, 0) == 0;
}
