#include "tests/common/coordinator.h"
#include "client/ccollectorclient.h"
#include "service/cserviceactivity.h"
#include "service/cservicecollector.h"
#include "service/cserviceoperation.h"

#include <gtest/gtest.h>

namespace testsupport
{
namespace
{
// How long a client call waits for the service.
const DWORD c_dwClientTimeoutMs = 10000;

std::wstring PipeName(const std::wstring &wstrGiven, const wchar_t *wszTag)
{
    return wstrGiven.empty() ? UniquePipeName(wszTag) : wstrGiven;
}
} // namespace

CTestCoordinator::CTestCoordinator(const std::wstring &wstrActivityPipe,
                                   const std::wstring &wstrCollectorPipe)
    : CTestPipeNames{PipeName(wstrActivityPipe, L"act"), PipeName(wstrCollectorPipe, L"col")}
    , TelvaneService(m_wstrActivityPipe.c_str(), m_wstrCollectorPipe.c_str())
{
}

void CTestCoordinator::StartAndWait()
{
    OnStart();
    ASSERT_TRUE(WaitUntil([&] { return State() == SERVICE_RUNNING; })) << State();
}

void CTestCoordinator::StopAndCheckDrained()
{
    OnStop();
    EXPECT_EQ(static_cast<DWORD>(SERVICE_STOPPED), State());
    // Everything the coordinator made is gone, and it holds no reference of its own.
    EXPECT_TRUE(WaitUntil([] {
        return CServiceActivity::LiveCount() == 0 && CServiceCollector::LiveCount() == 0 &&
               CServiceOperation::LiveCount() == 0;
    })) << CServiceActivity::LiveCount()
        << " activities, " << CServiceCollector::LiveCount() << " collectors, "
        << CServiceOperation::LiveCount() << " operations left";
    for (ULONG ulTag = 1; ulTag < c_cServiceTags; ulTag++)
    {
        EXPECT_EQ(0, TagCount(ulTag)) << "coordinator tag " << ulTag;
    }
}

CCollectorThread::CCollectorThread(const std::wstring &wstrPipe, const GUID &collectorId,
                                   std::string strResult, size_t cRequests)
    : m_wstrPipe(wstrPipe)
    , m_collectorId(collectorId)
    , m_strResult(std::move(strResult))
    , m_cRequests(cRequests)
    , m_thread([this] { Run(); })
{
}

CCollectorThread::~CCollectorThread()
{
    Stop();
}

void CCollectorThread::Run()
{
    CCollectorClient client(c_dwClientTimeoutMs);
    if (SUCCEEDED(client.Connect(m_wstrPipe.c_str())) && SUCCEEDED(client.Register(m_collectorId)))
    {
        m_fRegistered = true;
        size_t cAnswered = 0;
        while (!m_fStop && (m_cRequests == 0 || cAnswered < m_cRequests))
        {
            GUID activityId;
            GUID logId;
            HRESULT hr = client.WaitForRequest(&activityId, &logId, 250);
            if (hr == HRESULT_FROM_WIN32(ERROR_TIMEOUT))
            {
                continue;
            }
            if (FAILED(hr))
            {
                break;
            }
            {
                std::lock_guard<std::mutex> guard(m_lock);
                m_rgLogIds.push_back(logId);
            }
            while (m_fHold && !m_fStop)
            {
                Sleep(5);
            }
            if (m_fStop)
            {
                break;
            }
            if (FAILED(client.SendResult(m_strResult.data(), m_strResult.size())))
            {
                break;
            }
            cAnswered++;
        }
        if (!m_fStop && m_cRequests != 0)
        {
            client.BreakPipe();
        }
    }
    client.Close();
    m_fEnded = true;
}

bool CCollectorThread::WaitRegistered(DWORD dwTimeoutMs)
{
    return WaitUntil([&] { return m_fRegistered.load() || m_fEnded.load(); }, dwTimeoutMs) &&
           m_fRegistered;
}

bool CCollectorThread::WaitRequests(size_t c, DWORD dwTimeoutMs)
{
    return WaitUntil(
        [&] {
            std::lock_guard<std::mutex> guard(m_lock);
            return m_rgLogIds.size() >= c;
        },
        dwTimeoutMs);
}

std::vector<GUID> CCollectorThread::RequestLogIds() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_rgLogIds;
}

void CCollectorThread::Stop()
{
    m_fStop = true;
    if (m_thread.joinable())
    {
        m_thread.join();
    }
}
} // namespace testsupport
