// Start refuses to share its pipes: when another process (here: another handle) already holds
// either name, the service reports STOPPED with the error, starts nothing and leaves nothing
// running, so the DLL can be unloaded at once. With both names free it starts as usual.
#include "tests/core/coretest.h"
#include "service/cserviceactivity.h"
#include "service/cservicecollector.h"
#include "service/cserviceoperation.h"

using namespace coretest;

namespace
{
bool NameExists(const std::wstring &wstrPipe)
{
    return WaitNamedPipeW(wstrPipe.c_str(), 1) || GetLastError() != ERROR_FILE_NOT_FOUND;
}
} // namespace

TEST(CoreStart, RefusesToStartBesideAnotherHolderOfItsPipes)
{
    const struct
    {
        const char *szName;
        bool fActivity; // the name is taken
        bool fCollector;
    } rgCases[] = {
        {"activity pipe taken", true, false},
        {"collector pipe taken", false, true},
        {"both taken", true, true},
        {"both free", false, false},
    };
    FailureCapture failures;
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        CTestCoordinator service;
        std::vector<HANDLE> rgSquat;
        for (const std::wstring *pName : {c.fActivity ? &service.ActivityPipe() : nullptr,
                                          c.fCollector ? &service.CollectorPipe() : nullptr})
        {
            if (pName != nullptr)
            {
                rgSquat.push_back(CreateNamedPipeW(pName->c_str(), PIPE_ACCESS_DUPLEX,
                                                   PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE, 1,
                                                   1024, 1024, 0, nullptr));
                ASSERT_NE(INVALID_HANDLE_VALUE, rgSquat.back());
            }
        }
        bool fRefused = !rgSquat.empty();
        service.OnStart();
        DWORD dwState = fRefused ? SERVICE_STOPPED : SERVICE_RUNNING;
        ASSERT_TRUE(WaitUntil([&] { return service.State() == dwState; })) << service.State();
        EXPECT_EQ(fRefused ? static_cast<DWORD>(ERROR_ALREADY_EXISTS) : 0u, service.ExitCode());
        // A free name has a listener only while the service runs.
        if (!c.fActivity)
        {
            EXPECT_EQ(!fRefused, NameExists(service.ActivityPipe()));
        }
        if (!c.fCollector)
        {
            EXPECT_EQ(!fRefused, NameExists(service.CollectorPipe()));
        }
        if (!fRefused)
        {
            service.StopAndCheckDrained();
        }
        EXPECT_EQ(0, CServiceActivity::LiveCount());
        EXPECT_EQ(0, CServiceCollector::LiveCount());
        EXPECT_EQ(0, CServiceOperation::LiveCount());
        for (HANDLE h : rgSquat)
        {
            CloseHandle(h);
        }
    }
    failures.ExpectNone();
}
