// A holder field that owns one reference to X under the compile-time tag N. Read and written
// only inside its holder's handlers (or after the holder's destruction completed), so the
// field itself takes no lock. Platform-free, like the counts it drives.
#pragma once

#include "inc/taggedrefcount.h"

#include <cwchar>

// Names a class for the failure reports of CTaggedPtr<X, N>; declare once per held class
// next to its definition: TAGGED_PTR_CLASS_NAME(CServiceOperation)
template <class X>
struct TaggedPtrClassName;

#define TAGGED_PTR_CLASS_NAME(X)                                                                   \
    template <>                                                                                    \
    struct TaggedPtrClassName<class X>                                                             \
    {                                                                                              \
        static const wchar_t *Get() { return L"" #X; }                                             \
    }

template <class X, unsigned long N>
class CTaggedPtr
{
public:
    CTaggedPtr()
        : m_p(nullptr)
    {
    }

    ~CTaggedPtr() { Release(); }

    CTaggedPtr(const CTaggedPtr &) = delete;
    CTaggedPtr &operator=(const CTaggedPtr &) = delete;

    // A holder empties the pointer with Release() before giving it another object; giving it
    // the object it already holds changes nothing.
    X *operator=(X *p)
    {
        if (p == m_p)
        {
            return p;
        }
        if (p != nullptr)
        {
            p->AddRef(N);
        }
        if (m_p != nullptr)
        {
            wchar_t wszFunction[160];
            std::swprintf(wszFunction, sizeof(wszFunction) / sizeof(wszFunction[0]),
                          L"CTaggedPtr<class %ls,%lu>::operator =", TaggedPtrClassName<X>::Get(),
                          N);
            TaggedRefFailure(wszFunction, L"" __FILE__, __LINE__, L"Release() first");
        }
        m_p = p;
        return p;
    }

    // The field is empty before the object can be deleted by this release.
    void Release()
    {
        X *p = m_p;
        if (p != nullptr)
        {
            m_p = nullptr;
            p->Release(N);
        }
    }

    X *Get() const { return m_p; }
    X *operator->() const { return m_p; }
    operator X *() const { return m_p; }

private:
    X *m_p;
};
