// Start refuses to share its pipes: when another process (here: another handle) already holds
// either name, the service reports STOPPED with the error, starts nothing and leaves nothing
// running, so the DLL can be unloaded at once.
#include "tests/core/coretestsupport.h"
#include "service/cserviceactivity.h"
#include "service/cservicecollector.h"
#include "service/cserviceoperation.h"

using namespace coretest;

namespace
{
struct SquatCase
{
    const char *szName;
    bool fActivity;
    bool fCollector;
};

bool NameExists(const std::wstring &wstrPipe)
{
    return WaitNamedPipeW(wstrPipe.c_str(), 1) || GetLastError() != ERROR_FILE_NOT_FOUND;
}
} // namespace

TEST(CoreStart, RefusesToStartBesideAnotherHolderOfItsPipes)
{
    const SquatCase rgCases[] = {
        {"activity pipe taken", true, false},
        {"collector pipe taken", false, true},
        {"both taken", true, true},
    };
    testsupport::FailureCapture failures;
    CTraceSession trace;
    for (const SquatCase &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        std::wstring wstrActivity = pipetest::UniquePipeName(L"squatact");
        std::wstring wstrCollector = pipetest::UniquePipeName(L"squatcol");
        std::vector<HANDLE> rgSquat;
        for (const std::wstring *pName :
             {c.fActivity ? &wstrActivity : nullptr, c.fCollector ? &wstrCollector : nullptr})
        {
            if (pName != nullptr)
            {
                rgSquat.push_back(CreateNamedPipeW(pName->c_str(), PIPE_ACCESS_DUPLEX,
                                                   PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE, 1,
                                                   1024, 1024, 0, nullptr));
                ASSERT_NE(INVALID_HANDLE_VALUE, rgSquat.back());
            }
        }
        {
            CTestCoordinator service(wstrActivity.c_str(), wstrCollector.c_str());
            service.OnStart();
            ASSERT_TRUE(WaitUntil([&] { return service.State() == SERVICE_STOPPED; }))
                << service.State();
            EXPECT_EQ(static_cast<DWORD>(ERROR_ALREADY_EXISTS), service.ExitCode());
            // Nothing listens on a free name, and nothing of the service exists.
            if (!c.fActivity)
            {
                EXPECT_FALSE(NameExists(wstrActivity));
            }
            if (!c.fCollector)
            {
                EXPECT_FALSE(NameExists(wstrCollector));
            }
            EXPECT_EQ(0, CServiceActivity::LiveCount());
            EXPECT_EQ(0, CServiceCollector::LiveCount());
            EXPECT_EQ(0, CServiceOperation::LiveCount());
        }
        for (HANDLE h : rgSquat)
        {
            CloseHandle(h);
        }
    }
    EXPECT_EQ(0u, failures.Count());
    for (const std::wstring &line : failures.Lines())
    {
        ADD_FAILURE() << testsupport::Narrow(line);
    }
}

// The same coordinator, once its names are free, starts as usual.
TEST(CoreStart, StartsWhenItsNamesAreFree)
{
    testsupport::FailureCapture failures;
    std::wstring wstrActivity = pipetest::UniquePipeName(L"freeact");
    std::wstring wstrCollector = pipetest::UniquePipeName(L"freecol");
    CTestCoordinator service(wstrActivity.c_str(), wstrCollector.c_str());
    service.OnStart();
    ASSERT_TRUE(WaitUntil([&] { return service.State() == SERVICE_RUNNING; }));
    EXPECT_TRUE(NameExists(wstrActivity));
    EXPECT_TRUE(NameExists(wstrCollector));
    service.OnStop();
    EXPECT_EQ(static_cast<DWORD>(SERVICE_STOPPED), service.State());
    EXPECT_EQ(0u, service.ExitCode());
    EXPECT_EQ(0u, failures.Count());
}
