// telvane.dll under the prefix's control manager on the product's names, installed exactly as
// the README says (service installed, platform component registered, delivery values set):
// clients are served under Wine's svchost.exe and under telvanehost.exe, and a stop with a
// hundred clients drains them and the host leaves cleanly (its unload check passed). (A start
// beside another holder of a pipe name is CoreStart's.) These tests own "Telvane" and run on
// the test thread; the collector runs on its own.
#include "tests/core/coretest.h"
#include "tests/common/scmtest.h"

using namespace coretest;

namespace
{
class CoreScm : public ::testing::Test
{
protected:
    void SetUp() override { AllowDelivery(1); }
    void TearDown() override
    {
        TelvaneUninstall();
        DeleteLogsOfRuns(m_rgLogIds);
    }

    // A client on the product's activity pipe, started; its run's files go at the end.
    std::unique_ptr<CActivityClient> StartActivity()
    {
        m_rgLogIds.push_back(NewGuid());
        std::unique_ptr<CActivityClient> client(new CActivityClient(c_dwWaitMs));
        EXPECT_EQ(S_OK, client->Connect(c_wszTelvaneActivityPipe));
        EXPECT_EQ(S_OK, client->Start(NewGuid(), m_rgLogIds.back()));
        return client;
    }

    // Clients on the real pipes; a stop with a hundred of them connected drains them all.
    void ServeAndDrain(TelvaneHost hostKind, const wchar_t *wszHostImage)
    {
        ASSERT_NO_FATAL_FAILURE(TelvaneInstall(hostKind));
        CServiceProcess host(TelvaneStart());
        ASSERT_TRUE(host.Opened());
        EXPECT_NE(std::wstring::npos, host.ImageName().find(wszHostImage));
        GUID collectorId = NewGuid();
        CCollectorThread collector(c_wszTelvaneCollectorPipe, collectorId, "{\"host\":1}");
        ASSERT_TRUE(collector.WaitRegistered());

        // One run from start to end while the collector is there.
        GUID eventId = NewGuid();
        std::unique_ptr<CActivityClient> done = StartActivity();
        EXPECT_EQ(S_OK, done->SendEvent(eventId, "\"done\"", 6));
        ASSERT_TRUE(collector.WaitRequests(1));
        EXPECT_EQ(S_OK, done->Stop());
        EXPECT_EQ((std::vector<std::string>{"\"done\""}), OnlyLogValues(m_rgLogIds[0], eventId));
        EXPECT_EQ((std::vector<std::string>{"{\"host\":1}"}),
                  OnlyLogValues(m_rgLogIds[0], collectorId));

        // Then many runs still going when the stop comes.
        std::vector<std::unique_ptr<CActivityClient>> rgClients;
        for (size_t i = 0; i < 100; i++)
        {
            rgClients.push_back(StartActivity());
            EXPECT_EQ(S_OK, rgClients.back()->SendEvent(eventId, "1", 1));
        }
        ASSERT_TRUE(collector.WaitRequests(m_rgLogIds.size(), 120000));
        EXPECT_TRUE(TelvaneStop());
        SERVICE_STATUS_PROCESS status = {};
        EXPECT_TRUE(ServiceQueryStatus(c_wszTelvane, &status));
        EXPECT_EQ(0u, status.dwWin32ExitCode);
        // A clean exit: the unload check found nothing left (a failed check ends the host with
        // a fail-fast code).
        EXPECT_EQ(0u, host.WaitForExitCode(2 * c_dwWaitMs));
        RunLogs mapLogs = LogsByRun();
        for (const GUID &logId : m_rgLogIds)
        {
            std::vector<DeliveredLog> &rgLogs = mapLogs[GuidText(logId)];
            ASSERT_EQ(1u, rgLogs.size());
            EXPECT_TRUE(EndsRun(*rgLogs[0].doc));
        }
    }

    std::vector<GUID> m_rgLogIds;
};
} // namespace

TEST_F(CoreScm, ServesAndDrainsUnderSvchost)
{
    ServeAndDrain(TelvaneHost::Svchost, L"svchost.exe");
}

TEST_F(CoreScm, ServesAndDrainsUnderTelvaneHost)
{
    ServeAndDrain(TelvaneHost::TelvaneHost, L"telvanehost.exe");
}
