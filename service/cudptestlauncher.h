// Starts the UDP echo test application when the display backlight changes and the test
// policy allows it, at most one test process at a time, and watches it until it exits.
// Runs on its own queue (the backlight notification and the process wait only post to it);
// the coordinator owns it by value, subscribes it to the backlight state at start and
// destroys it at stop.
#pragma once

#include "servicelib/synchronizedobject.h"
#include "inc/handleholder.h"
#include "platform/statenotify/statenotify.h"
#include "service/udptestconfig.h"

#include <windows.h>

class CUDPTestLauncher : public SynchronizedObject
{
public:
    CUDPTestLauncher();
    ~CUDPTestLauncher() override;

    // The platform's state-change callback: context is the launcher. Any platform thread.
    static NTSTATUS NTAPI WnfNotificationCallback(WNF_STATE_NAME stateName,
                                                  WNF_CHANGE_STAMP changeStamp,
                                                  PWNF_TYPE_ID pTypeId, PVOID pvContext,
                                                  const VOID *pvData, ULONG cbData);

    // Where the coordinator's subscription keeps its handle (cleared when it fails).
    PWNF_USER_SUBSCRIPTION *SubscriptionSlot() { return &m_hWnfSubscription; }

    // The destroy request (EventType 1); any thread.
    void RequestDestroy();
    // Blocks until destruction has finished; the owner's thread, never the launcher's queue.
    void WaitForDestroyComplete();

    void Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2, ULONG_PTR ulArg3) override;

private:
    enum : ULONG
    {
        EventDestroy = 1,
        EventBacklightChanged = 2,
        EventCollectionComplete = 3,
    };

    void Dispatch_Destroy();
    void Dispatch_BacklightChanged(ULONG_PTR ulBacklightOn);
    void Dispatch_CollectionComplete();
    void Dispatch_AdvanceDestruction();

    // The gates of one test; each refusal is traced with its reason. Fills localIp.
    bool ShouldRunTest();
    // The process wait's callback: posts EventCollectionComplete.
    static VOID CALLBACK ProcessExitCallback(PVOID pvContext, BOOLEAN fTimedOut);

    HANDLE m_hProcess; // INVALID_HANDLE_VALUE when no test runs
    HANDLE m_hWait;
    CKernelHandle m_hDestroyed;
    PWNF_USER_SUBSCRIPTION m_hWnfSubscription;
    bool m_fConfigLoaded;
    bool m_fDestroying;
    UdpTestConfig m_config;
};
