// One RAII holder for every kind of Win32 handle the service owns: the holder closes what it
// holds when it goes out of scope or is given another value. A kind is a traits struct with
// its invalid value and its close call; each kind has one typedef below. Used on whatever
// thread owns the enclosing object; a holder is not shared between threads.
#pragma once

#include <windows.h>
#include <wincrypt.h>
#include <winhttp.h>

template <class Traits>
class CHandleHolder
{
public:
    typedef typename Traits::Type Type;

    CHandleHolder()
        : m_h(Traits::Invalid())
    {
    }
    explicit CHandleHolder(Type h)
        : m_h(h)
    {
    }
    ~CHandleHolder() { Close(); }

    CHandleHolder(const CHandleHolder &) = delete;
    CHandleHolder &operator=(const CHandleHolder &) = delete;

    CHandleHolder(CHandleHolder &&other) noexcept
        : m_h(other.Detach())
    {
    }
    CHandleHolder &operator=(CHandleHolder &&other) noexcept
    {
        if (this != &other)
        {
            Reset(other.Detach());
        }
        return *this;
    }

    Type Get() const { return m_h; }
    bool IsValid() const { return m_h != Traits::Invalid(); }
    explicit operator bool() const { return IsValid(); }

    // For out-parameters of the calls that open the handle (RegOpenKeyExW and the like):
    // closes what is held first.
    Type *Receive()
    {
        Close();
        return &m_h;
    }

    void Reset(Type h = Traits::Invalid())
    {
        if (h != m_h)
        {
            Close();
            m_h = h;
        }
    }

    Type Detach()
    {
        Type h = m_h;
        m_h = Traits::Invalid();
        return h;
    }

    // Returns the close call's result; callers that must report a failed close use this
    // instead of leaving it to the destructor.
    BOOL Close()
    {
        BOOL fOk = TRUE;
        if (m_h != Traits::Invalid())
        {
            fOk = Traits::Close(m_h);
            m_h = Traits::Invalid();
        }
        return fOk;
    }

private:
    Type m_h;
};

struct HandleTraitsKernel // events, processes, threads, mutexes: null when empty
{
    typedef HANDLE Type;
    static Type Invalid() { return nullptr; }
    static BOOL Close(Type h) { return CloseHandle(h); }
};

struct HandleTraitsFile // CreateFileW and CreateNamedPipeW: INVALID_HANDLE_VALUE when empty
{
    typedef HANDLE Type;
    static Type Invalid() { return INVALID_HANDLE_VALUE; }
    static BOOL Close(Type h) { return CloseHandle(h); }
};

struct HandleTraitsFind
{
    typedef HANDLE Type;
    static Type Invalid() { return INVALID_HANDLE_VALUE; }
    static BOOL Close(Type h) { return FindClose(h); }
};

struct HandleTraitsRegKey
{
    typedef HKEY Type;
    static Type Invalid() { return nullptr; }
    static BOOL Close(Type h) { return RegCloseKey(h) == ERROR_SUCCESS; }
};

struct HandleTraitsModule
{
    typedef HMODULE Type;
    static Type Invalid() { return nullptr; }
    static BOOL Close(Type h) { return FreeLibrary(h); }
};

struct HandleTraitsCertStore
{
    typedef HCERTSTORE Type;
    static Type Invalid() { return nullptr; }
    static BOOL Close(Type h) { return CertCloseStore(h, 0); }
};

struct HandleTraitsCertContext
{
    typedef PCCERT_CONTEXT Type;
    static Type Invalid() { return nullptr; }
    static BOOL Close(Type h) { return CertFreeCertificateContext(h); }
};

// Close only after the wait was cancelled and its callbacks waited for (or from inside the
// callback itself, which frees the wait once the callback ends).
struct HandleTraitsThreadpoolWait
{
    typedef PTP_WAIT Type;
    static Type Invalid() { return nullptr; }
    static BOOL Close(Type h)
    {
        CloseThreadpoolWait(h);
        return TRUE;
    }
};

struct HandleTraitsService // control-manager and service handles
{
    typedef SC_HANDLE Type;
    static Type Invalid() { return nullptr; }
    static BOOL Close(Type h) { return CloseServiceHandle(h); }
};

struct HandleTraitsWinHttp // sessions, connections and requests of the platform HTTP client
{
    typedef HINTERNET Type;
    static Type Invalid() { return nullptr; }
    static BOOL Close(Type h) { return WinHttpCloseHandle(h); }
};

typedef CHandleHolder<HandleTraitsKernel> CKernelHandle;
typedef CHandleHolder<HandleTraitsFile> CFileHandle;
typedef CHandleHolder<HandleTraitsFind> CFindHandle;
typedef CHandleHolder<HandleTraitsRegKey> CRegKeyHandle;
typedef CHandleHolder<HandleTraitsModule> CModuleHandle;
typedef CHandleHolder<HandleTraitsCertStore> CCertStoreHandle;
typedef CHandleHolder<HandleTraitsCertContext> CCertContextHandle;
typedef CHandleHolder<HandleTraitsThreadpoolWait> CThreadpoolWaitHandle;
typedef CHandleHolder<HandleTraitsService> CServiceHandle;
typedef CHandleHolder<HandleTraitsWinHttp> CWinHttpHandle;
