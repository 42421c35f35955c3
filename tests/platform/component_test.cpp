// The platform component as the service meets it: registered in the prefix with regsvr32,
// created with CoCreateInstance from a thread-pool thread, in a process whose main thread is
// in the MTA (our own hosts) and in one where no thread entered it (Wine's svchost), which
// needs CoIncrementMTAUsage; then unregistered.
#include "platform/component/platformcomponent.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>

#include <objbase.h>
#include <string>

namespace
{
#define COMPONENT_CLASS_KEY L"Software\\Classes\\CLSID\\{B5368813-926B-449C-9676-DB6ED6F8F428}"
const wchar_t c_wszClassKey[] = COMPONENT_CLASS_KEY;
const wchar_t c_wszServerKey[] = COMPONENT_CLASS_KEY L"\\InprocServer32";

std::wstring ComponentPath()
{
    return testsupport::BinDir() + L"platformcomponent.dll";
}

// The registered server's value, or empty when the class is not registered.
std::wstring ReadServerValue(const wchar_t *wszValue)
{
    DWORD dwType = 0;
    std::wstring wstr;
    return testsupport::HklmReadRaw(c_wszServerKey, wszValue, &dwType, &wstr) ? wstr.c_str()
                                                                              : std::wstring();
}

testsupport::ChildResult Regsvr32(const std::wstring &wstrSwitches, const std::wstring &wstrPath)
{
    return testsupport::RunChild(L"regsvr32.exe " + wstrSwitches + L" \"" + wstrPath + L"\"");
}

struct CreateResult
{
    HRESULT hr = E_UNEXPECTED;
    DWORD dwHostProcessId = 0;
    ULONG cObjects = 0;
};

// CoCreateInstance on a thread of the system pool, as the service's start does; the pool
// thread itself never calls CoInitializeEx.
CreateResult CreateOnPoolThread()
{
    struct Work
    {
        CreateResult result;
        HANDLE hDone;
    } work;
    work.hDone = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    auto pfnWork = [](PTP_CALLBACK_INSTANCE, PVOID pv) {
        Work *pWork = static_cast<Work *>(pv);
        IPlatformComponent *pComponent = nullptr;
        pWork->result.hr =
            CoCreateInstance(CLSID_PlatformComponent, nullptr, CLSCTX_ALL, IID_IPlatformComponent,
                             reinterpret_cast<void **>(&pComponent));
        if (SUCCEEDED(pWork->result.hr))
        {
            pComponent->GetHostProcessId(&pWork->result.dwHostProcessId);
            pComponent->GetObjectCount(&pWork->result.cObjects);
            pComponent->Release();
        }
        SetEvent(pWork->hDone);
    };
    if (!TrySubmitThreadpoolCallback(pfnWork, &work, nullptr))
    {
        work.result.hr = HRESULT_FROM_WIN32(GetLastError());
    }
    else if (WaitForSingleObject(work.hDone, 60000) != WAIT_OBJECT_0)
    {
        work.result.hr = HRESULT_FROM_WIN32(WAIT_TIMEOUT);
    }
    CloseHandle(work.hDone);
    return work.result;
}

// Registers the component for one test and puts back what was registered before it. Runs
// on the test's main thread.
class PlatformComponentRegistration : public ::testing::Test
{
protected:
    void SetUp() override
    {
        m_wstrPrevious = ReadServerValue(nullptr);
        testsupport::ChildResult result = Regsvr32(L"/s", ComponentPath());
        ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
    }
    void TearDown() override
    {
        testsupport::ChildResult result = m_wstrPrevious.empty()
                                              ? Regsvr32(L"/u /s", ComponentPath())
                                              : Regsvr32(L"/s", m_wstrPrevious);
        EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
    }

    std::wstring m_wstrPrevious;
};
} // namespace

// Registered with threading model "Both", the class is created in-process (the object is
// the DLL's own, not a proxy to another process) on a pool thread whenever the process uses
// the MTA: through its main thread (our own hosts) or, where no thread entered it (Wine's
// svchost), through CoIncrementMTAUsage, and only as long as that lasts and it is registered.
TEST_F(PlatformComponentRegistration,
       CreatedOnAPoolThreadWhileTheProcessUsesTheMtaUntilUnregistered)
{
    EXPECT_EQ(0, _wcsicmp(ComponentPath().c_str(), ReadServerValue(nullptr).c_str()))
        << testsupport::Narrow(ReadServerValue(nullptr));
    EXPECT_EQ(L"Both", ReadServerValue(L"ThreadingModel"));

    EXPECT_EQ(CO_E_NOTINITIALIZED, CreateOnPoolThread().hr);
    CO_MTA_USAGE_COOKIE cookie = nullptr;
    ASSERT_HRESULT_SUCCEEDED(CoIncrementMTAUsage(&cookie));
    CreateResult result = CreateOnPoolThread();
    EXPECT_EQ(S_OK, result.hr);
    EXPECT_EQ(GetCurrentProcessId(), result.dwHostProcessId);
    EXPECT_HRESULT_SUCCEEDED(CoDecrementMTAUsage(cookie));
    EXPECT_EQ(CO_E_NOTINITIALIZED, CreateOnPoolThread().hr);

    ASSERT_HRESULT_SUCCEEDED(CoInitializeEx(nullptr, COINIT_MULTITHREADED));
    result = CreateOnPoolThread();
    EXPECT_EQ(S_OK, result.hr);
    EXPECT_EQ(GetCurrentProcessId(), result.dwHostProcessId);
    EXPECT_EQ(1u, result.cObjects);

    // Unregistered, the class is gone; a second unregistration finds nothing to remove, and
    // that is no failure.
    for (int i = 0; i < 2; i++)
    {
        testsupport::ChildResult removed = Regsvr32(L"/u /s", ComponentPath());
        ASSERT_EQ(0u, removed.dwExitCode) << removed.strOutput;
    }
    EXPECT_EQ(L"", ReadServerValue(nullptr));
    HKEY hKey = nullptr;
    EXPECT_EQ(ERROR_FILE_NOT_FOUND,
              RegOpenKeyExW(HKEY_LOCAL_MACHINE, c_wszClassKey, 0, KEY_READ, &hKey));
    EXPECT_EQ(REGDB_E_CLASSNOTREG, CreateOnPoolThread().hr);
    CoUninitialize();
}
