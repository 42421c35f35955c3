// The asynchronous destroy protocol of every owned, reference-counted object: the owner
// asks with Destroy (any thread), waits on its own thread with WaitForDestroyComplete
// (never inside the object's handlers), then drops its tagged reference.
#pragma once

#include <windows.h>
#include "inc/ctaggedptr.h"

class IDestroyable
{
public:
    virtual void Destroy() = 0;
    virtual void WaitForDestroyComplete() = 0;
    virtual ULONG AddRef(ULONG ulTag) = 0;
    virtual ULONG Release(ULONG ulTag) = 0;

    // WaitForDestroyComplete in two halves, so that an owner of many objects can wait for all
    // of them before it gives any the settling pause that some need: the first blocks until the
    // object's destroy event and says whether the object wants that pause (the owner then
    // pauses once for all), the second does the rest. The defaults suit an object without one.
    virtual bool WaitForDestroyEvent()
    {
        WaitForDestroyComplete();
        return false;
    }
    virtual void FinishDestroy() {}

protected:
    ~IDestroyable() = default;
};

TAGGED_PTR_CLASS_NAME(IDestroyable);
