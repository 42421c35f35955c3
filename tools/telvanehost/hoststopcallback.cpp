#include "tools/telvanehost/hoststopcallback.h"

#include <memory>
#include <mutex>
#include <condition_variable>
#include <vector>

namespace
{
// One registration. Kept until the process ends: the thread pool may still be returning
// from the wrapper after the service unregistered the wait.
struct HOST_STOP_REGISTRATION
{
    WAITORTIMERCALLBACK pfnCallback;
    PVOID pvContext;
    LONG fCalled;
};

std::mutex s_lock;
std::condition_variable s_idle;
std::vector<std::unique_ptr<HOST_STOP_REGISTRATION>> s_rgRegistrations;
ULONG s_cRunning = 0;

VOID CALLBACK HostStopWaitCallback(PVOID pvContext, BOOLEAN fTimedOut)
{
    HOST_STOP_REGISTRATION *pRegistration = static_cast<HOST_STOP_REGISTRATION *>(pvContext);
    // The wait is one-shot already; this only guards against a second signal racing it.
    if (InterlockedExchange(&pRegistration->fCalled, TRUE) != FALSE)
    {
        return;
    }
    {
        std::lock_guard<std::mutex> guard(s_lock);
        s_cRunning++;
    }
    pRegistration->pfnCallback(pRegistration->pvContext, FALSE);
    {
        std::lock_guard<std::mutex> guard(s_lock);
        s_cRunning--;
    }
    s_idle.notify_all();
}
} // namespace

DWORD WINAPI HostRegisterStopCallback(PHANDLE phNewWaitObject, PCWSTR wszServiceName,
                                      HANDLE hObject, WAITORTIMERCALLBACK pfnCallback,
                                      PVOID pvContext, DWORD dwFlags)
{
    if (phNewWaitObject == nullptr || hObject == nullptr || pfnCallback == nullptr)
    {
        return ERROR_INVALID_PARAMETER;
    }
    std::unique_ptr<HOST_STOP_REGISTRATION> registration(
        new HOST_STOP_REGISTRATION{pfnCallback, pvContext, FALSE});
    HOST_STOP_REGISTRATION *pRegistration = registration.get();
    {
        std::lock_guard<std::mutex> guard(s_lock);
        s_rgRegistrations.push_back(std::move(registration));
    }
    // A stop brings the service down completely before the callback returns: a long function.
    if (!RegisterWaitForSingleObject(phNewWaitObject, hObject, HostStopWaitCallback, pRegistration,
                                     INFINITE,
                                     WT_EXECUTEONLYONCE | WT_EXECUTELONGFUNCTION | dwFlags))
    {
        return GetLastError();
    }
    return ERROR_SUCCESS;
}

bool HostWaitForStopCallbacks(DWORD dwTimeoutMs)
{
    std::unique_lock<std::mutex> guard(s_lock);
    return s_idle.wait_for(guard, std::chrono::milliseconds(dwTimeoutMs),
                           [] { return s_cRunning == 0; });
}
