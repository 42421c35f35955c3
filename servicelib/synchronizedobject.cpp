#include "servicelib/synchronizedobject.h"
#include "servicelib/diagnostics.h"

Synchronizer::Synchronizer()
    : m_cRef(1)
    , m_fBusy(false)
    , m_fDeletePending(false)
{
    InitializeCriticalSection(&m_lock);
}

Synchronizer::~Synchronizer()
{
    ASSERT_CHECK(L"Synchronizer::~Synchronizer", m_queue.empty() && !m_fBusy && m_cRef == 0);
    DeleteCriticalSection(&m_lock);
}

void Synchronizer::Post(SynchronizedObject *pTarget, ULONG ulEventType, ULONG_PTR ulArg1,
                        ULONG_PTR ulArg2, ULONG_PTR ulArg3)
{
    // The queued or running event keeps its target alive.
    pTarget->AddRef();

    EnterCriticalSection(&m_lock);
    if (m_fBusy)
    {
        m_queue.push_back(SynchronizerEvent{pTarget, ulEventType, ulArg1, ulArg2, ulArg3});
        LeaveCriticalSection(&m_lock);
        return;
    }

    m_fBusy = true;
    for (;;)
    {
        LeaveCriticalSection(&m_lock);
        pTarget->Dispatch(ulEventType, ulArg1, ulArg2, ulArg3);
        // May delete the target; its destructor then leaves the Synchronizer to this loop.
        pTarget->Release();
        EnterCriticalSection(&m_lock);
        if (m_queue.empty())
        {
            break;
        }
        const SynchronizerEvent &next = m_queue.front();
        pTarget = next.pTarget;
        ulEventType = next.ulEventType;
        ulArg1 = next.ulArg1;
        ulArg2 = next.ulArg2;
        ulArg3 = next.ulArg3;
        m_queue.pop_front();
    }
    bool fDelete = m_fDeletePending;
    m_fBusy = false;
    LeaveCriticalSection(&m_lock);
    if (fDelete)
    {
        delete this;
    }
}

void Synchronizer::ReleaseOwner()
{
    if (InterlockedDecrement(&m_cRef) != 0)
    {
        return;
    }
    EnterCriticalSection(&m_lock);
    bool fBusy = m_fBusy;
    m_fDeletePending = fBusy;
    LeaveCriticalSection(&m_lock);
    if (!fBusy)
    {
        delete this;
    }
}

SynchronizedObject::SynchronizedObject()
    : m_pSynchronizer(new Synchronizer())
{
}

SynchronizedObject::~SynchronizedObject()
{
    m_pSynchronizer->ReleaseOwner();
    m_pSynchronizer = nullptr;
}

void SynchronizedObject::FatalUnknownEvent(const wchar_t *wszFunction, const wchar_t *wszName,
                                           const wchar_t *wszFile, ULONG ulLine, ULONG ulEventType)
{
    FatalError(wszFunction, wszFile, ulLine, wszName, ulEventType);
}
