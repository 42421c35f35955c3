// Stand-in for the phone's state-notification facility: named, machine-wide state values
// (a 64-bit state name, a change stamp and up to 4 KiB of data) that any process may publish
// and any process may query or subscribe to. A subscriber is called on a thread-pool thread
// with the state's latest value whenever its change stamp passed the last one delivered
// (changes in quick succession may arrive as one call, with the latest value), one call at a
// time per subscription. Every function may be called from any thread.
//
// Publishing is not part of the facility's calls that the service makes; telvanectl and the
// tests publish through platform/statenotify/statenotifypublish.h.
#pragma once

#include <windows.h>

#ifndef _NTDEF_
typedef LONG NTSTATUS;
#endif
#ifndef NTAPI
#define NTAPI __stdcall
#endif
#ifndef NT_SUCCESS
#define NT_SUCCESS(Status) (((NTSTATUS)(Status)) >= 0)
#endif
#ifndef STATUS_SUCCESS
#define STATUS_SUCCESS ((NTSTATUS)0x00000000L)
#endif
#ifndef STATUS_BUFFER_TOO_SMALL
#define STATUS_BUFFER_TOO_SMALL ((NTSTATUS)0xC0000023L)
#endif
// winnt.h already defines STATUS_INVALID_PARAMETER (0xC000000D) and STATUS_NO_MEMORY
// (0xC0000017) as DWORD values: compare them with a cast to NTSTATUS.

// Largest data a state value holds.
#define WNF_STATE_MAX_DATA_SIZE 4096

#ifdef __cplusplus
extern "C"
{
#endif

    typedef ULONGLONG WNF_STATE_NAME;
    typedef const WNF_STATE_NAME *PCWNF_STATE_NAME;

    // Rises by one with every publication of a state; 0 for a state never published.
    typedef ULONG WNF_CHANGE_STAMP, *PWNF_CHANGE_STAMP;

    typedef struct _WNF_TYPE_ID
    {
        GUID TypeId;
    } WNF_TYPE_ID, *PWNF_TYPE_ID;
    typedef const WNF_TYPE_ID *PCWNF_TYPE_ID;

    // Opaque; null is never a valid subscription.
    typedef struct _WNF_USER_SUBSCRIPTION *PWNF_USER_SUBSCRIPTION;

    // Called on a thread-pool thread with the state's data at the given change stamp (Buffer
    // is valid for the call only; null when BufferSize is 0). TypeId is the subscriber's own
    // type identifier, or null. The return value is ignored.
    typedef NTSTATUS(NTAPI *PWNF_USER_CALLBACK)(WNF_STATE_NAME StateName,
                                                WNF_CHANGE_STAMP ChangeStamp, PWNF_TYPE_ID TypeId,
                                                PVOID CallbackContext, const VOID *Buffer,
                                                ULONG BufferSize);

    // Subscribes Callback to every change of StateName whose change stamp is above ChangeStamp:
    // with 0, a state that was ever published is delivered once at once, with its current
    // value. States carry no type: TypeId is only handed back to the callback.
    // SerializationGroup is accepted for compatibility (every subscription is serialized on its
    // own); Flags must be 0. On success *Subscription receives the subscription.
    NTSTATUS NTAPI RtlSubscribeWnfStateChangeNotification(
        PWNF_USER_SUBSCRIPTION *Subscription, WNF_STATE_NAME StateName,
        WNF_CHANGE_STAMP ChangeStamp, PWNF_USER_CALLBACK Callback, PVOID CallbackContext,
        PCWNF_TYPE_ID TypeId, ULONG SerializationGroup, ULONG Flags);

    // Ends a subscription: no callback starts after it returns, and a callback that runs on
    // another thread is waited for. Called from inside this subscription's own callback it
    // does not wait (it would wait for itself): that callback is the last, and the
    // subscription is freed when it returns. The subscription is invalid afterwards.
    NTSTATUS NTAPI
    RtlUnsubscribeWnfNotificationWaitForCompletion(PWNF_USER_SUBSCRIPTION Subscription);

    // Reads a state's current value. *BufferSize is the buffer's size on the way in and the
    // data's size on the way out; a buffer too small for the data gets nothing and
    // STATUS_BUFFER_TOO_SMALL, with the size needed in *BufferSize. A state never published
    // reads as success with change stamp 0 and no data. TypeId and ExplicitScope are accepted
    // and ignored (states carry no type; every state is machine-wide). ChangeStamp may be null.
    NTSTATUS NTAPI NtQueryWnfStateData(PCWNF_STATE_NAME StateName, PCWNF_TYPE_ID TypeId,
                                       const VOID *ExplicitScope, PWNF_CHANGE_STAMP ChangeStamp,
                                       PVOID Buffer, PULONG BufferSize);

#ifdef __cplusplus
}
#endif
