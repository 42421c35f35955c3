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

protected:
    ~IDestroyable() = default;
};

TAGGED_PTR_CLASS_NAME(IDestroyable);
