// An event number a class does not know is a fatal error reported from the class's Dispatch
// with its "EventType %u" name as it stands and the number as the code (the activity endpoint
// keeps the client library's historical class name in it).
#include "tests/core/coretest.h"
#include "service/cserviceactivity.h"
#include "service/cservicecollector.h"
#include "service/cserviceoperation.h"
#include "service/cudptestlauncher.h"

using namespace coretest;

TEST(CoreDispatch, UnknownEventsNameTheClassAndTheNumber)
{
    FailureCapture failures;
    CTestCoordinator service;
    DWORD dwError = 0;
    // Endpoints whose pipe instances are made but never listened on.
    CServiceActivity *pActivity = new CServiceActivity(&service, &dwError);
    ASSERT_EQ(0u, dwError);
    CServiceCollector *pCollector = new CServiceCollector(&service, &dwError);
    ASSERT_EQ(0u, dwError);
    CServiceOperation *pOperation = new CServiceOperation(&service, NewGuid(), pActivity);
    CUDPTestLauncher launcher;

    struct Case
    {
        SynchronizedObject *pObject;
        const wchar_t *wszFunction;
        const wchar_t *wszName;
    };
    const Case rgCases[] = {
        {&service, L"TelvaneService::Dispatch", L"TelvaneService::EventType %u"},
        {pActivity, L"CServiceActivity::Dispatch", L"CClientActivity::EventType %u"},
        {pCollector, L"CServiceCollector::Dispatch", L"CServiceCollector::EventType %u"},
        {pOperation, L"CServiceOperation::Dispatch", L"CServiceOperation::EventType %u"},
        {&launcher, L"CUDPTestLauncher::Dispatch", L"CUDPTestLauncher::EventType %u"},
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(Narrow(c.wszFunction));
        size_t cBefore = failures.Count();
        c.pObject->Dispatch(99, 0, 0, 0);
        ASSERT_EQ(cBefore + 1, failures.Count());
        std::wstring wstrLine = failures.Lines().back();
        EXPECT_NE(std::wstring::npos, wstrLine.find(c.wszFunction)) << Narrow(wstrLine);
        EXPECT_NE(std::wstring::npos, wstrLine.find(std::wstring(L"0x63 from ") + c.wszName))
            << Narrow(wstrLine);
    }
    pOperation->Release(0);
    pCollector->Release(0);
    pActivity->Release(0);
    EXPECT_EQ(0, CServiceActivity::LiveCount());
    EXPECT_EQ(0, CServiceOperation::LiveCount());
}
