// The facility's three calls, on top of the machine-wide store and one CWnfSubscription per
// subscriber.
#include "platform/statenotify/statenotify.h"

#include "inc/handleholder.h"
#include "platform/statenotify/cwnfsubscription.h"
#include "platform/statenotify/statestore.h"

#include <new>
#include <string.h>

extern "C" NTSTATUS NTAPI RtlSubscribeWnfStateChangeNotification(
    PWNF_USER_SUBSCRIPTION *Subscription, WNF_STATE_NAME StateName, WNF_CHANGE_STAMP ChangeStamp,
    PWNF_USER_CALLBACK Callback, PVOID CallbackContext, PCWNF_TYPE_ID TypeId,
    ULONG SerializationGroup, ULONG Flags)
{
    if (Subscription == nullptr)
    {
        return static_cast<NTSTATUS>(STATUS_INVALID_PARAMETER);
    }
    *Subscription = nullptr;
    if (Callback == nullptr || Flags != 0)
    {
        return static_cast<NTSTATUS>(STATUS_INVALID_PARAMETER);
    }
    CWnfSubscription *pSubscription = new (std::nothrow)
        CWnfSubscription(StateName, ChangeStamp, Callback, CallbackContext, TypeId);
    if (pSubscription == nullptr)
    {
        return static_cast<NTSTATUS>(STATUS_NO_MEMORY);
    }
    NTSTATUS status = pSubscription->Start();
    if (!NT_SUCCESS(status))
    {
        // Start arms the wait last, so no callback can be running.
        delete pSubscription;
        return status;
    }
    *Subscription = reinterpret_cast<PWNF_USER_SUBSCRIPTION>(pSubscription);
    return STATUS_SUCCESS;
}

extern "C" NTSTATUS NTAPI
RtlUnsubscribeWnfNotificationWaitForCompletion(PWNF_USER_SUBSCRIPTION Subscription)
{
    if (Subscription == nullptr)
    {
        return static_cast<NTSTATUS>(STATUS_INVALID_PARAMETER);
    }
    CWnfSubscription *pSubscription = reinterpret_cast<CWnfSubscription *>(Subscription);
    if (pSubscription->Stop())
    {
        delete pSubscription;
    }
    return STATUS_SUCCESS;
}

extern "C" NTSTATUS NTAPI NtQueryWnfStateData(PCWNF_STATE_NAME StateName, PCWNF_TYPE_ID TypeId,
                                              const VOID *ExplicitScope,
                                              PWNF_CHANGE_STAMP ChangeStamp, PVOID Buffer,
                                              PULONG BufferSize)
{
    if (StateName == nullptr || BufferSize == nullptr || (Buffer == nullptr && *BufferSize > 0))
    {
        return static_cast<NTSTATUS>(STATUS_INVALID_PARAMETER);
    }
    WNF_CHANGE_STAMP stamp = 0;
    BYTE rgbData[WNF_STATE_MAX_DATA_SIZE];
    ULONG cbData = 0;
    CRegKeyHandle hKey;
    LONG lError = StateStoreOpenKey(*StateName, KEY_QUERY_VALUE, false, hKey.Receive());
    if (lError == ERROR_SUCCESS)
    {
        lError = StateStoreRead(hKey.Get(), &stamp, rgbData, &cbData);
    }
    else if (lError == ERROR_FILE_NOT_FOUND)
    {
        lError = ERROR_SUCCESS; // never published, nor subscribed to
    }
    if (lError != ERROR_SUCCESS)
    {
        return StateStoreStatusFromError(lError);
    }
    if (ChangeStamp != nullptr)
    {
        *ChangeStamp = stamp;
    }
    if (cbData > *BufferSize)
    {
        *BufferSize = cbData;
        return STATUS_BUFFER_TOO_SMALL;
    }
    if (cbData > 0)
    {
        memcpy(Buffer, rgbData, cbData);
    }
    *BufferSize = cbData;
    return STATUS_SUCCESS;
}
