// Starts the UDP echo test when the display backlight changes. For now it has its lifecycle
// only: the backlight notification reaches its queue and is traced, and the coordinator's
// shutdown drains it. Runs on its own queue; the coordinator owns it by value, subscribes it
// to the backlight state at start and destroys it at stop.
#pragma once

#include "servicelib/synchronizedobject.h"
#include "inc/handleholder.h"
#include "platform/statenotify/statenotify.h"

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

    HANDLE m_hProcess; // INVALID_HANDLE_VALUE when no test runs
    HANDLE m_hWait;
    CKernelHandle m_hDestroyed;
    PWNF_USER_SUBSCRIPTION m_hWnfSubscription;
    bool m_fConfigLoaded;
    bool m_fDestroying;
};
