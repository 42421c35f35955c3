// The serialized event queue every long-lived object runs on. There is no thread per
// object: whoever posts to an idle object runs its handlers on the spot, and a post to a
// busy object leaves the event for the thread already inside.
#pragma once

#include <windows.h>
#include <deque>

class SynchronizedObject;

struct SynchronizerEvent
{
    SynchronizedObject *pTarget;
    ULONG ulEventType;
    ULONG_PTR ulArg1;
    ULONG_PTR ulArg2;
    ULONG_PTR ulArg3;
};

// One per SynchronizedObject, never shared. Its lock guards only its own fields and is
// never held while a handler, AddRef or Release runs. Deleted by the object's destructor,
// or, when that runs inside a dispatch, by the dispatching thread once the queue drains.
class Synchronizer
{
public:
    Synchronizer();
    ~Synchronizer();

    Synchronizer(const Synchronizer &) = delete;
    Synchronizer &operator=(const Synchronizer &) = delete;

    void Post(SynchronizedObject *pTarget, ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2,
              ULONG_PTR ulArg3);

    // The owning object is going away (its destructor).
    void ReleaseOwner();

private:
    volatile LONG m_cRef;
    CRITICAL_SECTION m_lock;
    bool m_fBusy;
    bool m_fDeletePending;
    std::deque<SynchronizerEvent> m_queue;
};

// Primary base of every object with a Synchronizer. Handlers run only through Post, one at
// a time, in the order their posters took the Synchronizer's lock.
class SynchronizedObject
{
public:
    SynchronizedObject();
    virtual ~SynchronizedObject();

    SynchronizedObject(const SynchronizedObject &) = delete;
    SynchronizedObject &operator=(const SynchronizedObject &) = delete;

    virtual void Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2,
                          ULONG_PTR ulArg3) = 0;
    // Queued and running events hold the target through these; the defaults count nothing.
    virtual ULONG AddRef() { return 1; }
    virtual ULONG Release() { return 1; }

protected:
    void Post(ULONG ulEventType, ULONG_PTR ulArg1 = 0, ULONG_PTR ulArg2 = 0, ULONG_PTR ulArg3 = 0)
    {
        m_pSynchronizer->Post(this, ulEventType, ulArg1, ulArg2, ulArg3);
    }

    // The fatal error of Dispatch for an event number the class does not know: reported from
    // wszFunction ("<class>::Dispatch") with the name text as it stands ("<class>::EventType
    // %u", unformatted) and the number as the code.
    static void FatalUnknownEvent(const wchar_t *wszFunction, const wchar_t *wszName,
                                  const wchar_t *wszFile, ULONG ulLine, ULONG ulEventType);

    Synchronizer *m_pSynchronizer;
};

// DISPATCH_UNKNOWN_EVENT(L"CServiceActivity::Dispatch", L"CClientActivity::EventType %u", n)
#define DISPATCH_UNKNOWN_EVENT(wszFunction, wszName, ulEventType)                                  \
    FatalUnknownEvent((wszFunction), (wszName), TELVANE_WFILE, __LINE__, (ulEventType))
