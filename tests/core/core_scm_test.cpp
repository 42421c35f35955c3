// telvane.dll under the prefix's control manager on the product's names, installed exactly as
// the README says (service installed, platform component registered, delivery values set):
// clients are served under Wine's svchost.exe and under telvanehost.exe, a stop with a hundred
// clients drains them and the host leaves cleanly (its unload check passed), and a start
// beside another holder of a pipe name is refused without harm. These tests own "Telvane".
#include "tests/core/coretestsupport.h"
#include "tests/common/scmtest.h"

using namespace coretest;

namespace
{
const wchar_t c_wszTelvane[] = L"Telvane";
const DWORD c_dwStateWaitMs = 60000;

testsupport::ChildResult RunInBin(const std::wstring &wstrCommand)
{
    return testsupport::RunChild(wstrCommand);
}

class CoreScm : public ::testing::Test
{
protected:
    void SetUp() override
    {
        EnableFileDelivery();
        // The README's steps: install, register the component.
        ASSERT_EQ(0u, RunInBin(L"\"" + testsupport::BinDir() + L"telvanerun.exe\" -r").dwExitCode);
        ASSERT_EQ(0u,
                  RunInBin(L"regsvr32 /s \"" + testsupport::BinDir() + L"platformcomponent.dll\"")
                      .dwExitCode);
    }
    void TearDown() override
    {
        RunInBin(L"\"" + testsupport::BinDir() + L"telvanerun.exe\" -u");
        RunInBin(L"regsvr32 /s /u \"" + testsupport::BinDir() + L"platformcomponent.dll\"");
        testsupport::ServiceStopAndDelete(c_wszTelvane);
        for (const GUID &logId : m_rgLogIds)
        {
            DeleteLogsOf(logId);
        }
    }

    void UseTelvaneHost()
    {
        ASSERT_TRUE(testsupport::ServiceSetImagePath(c_wszTelvane, L"\"" + testsupport::BinDir() +
                                                            L"telvanehost.exe\" -k OVTCBNetwork"));
    }

    // Starts the service and checks the host it runs in; returns its process id.
    DWORD StartIn(const wchar_t *wszHostImage)
    {
        EXPECT_EQ(0u, testsupport::ServiceStart(c_wszTelvane, {}));
        SERVICE_STATUS_PROCESS status = {};
        EXPECT_TRUE(testsupport::ServiceWaitForState(c_wszTelvane, SERVICE_RUNNING, c_dwStateWaitMs, &status))
            << status.dwCurrentState;
        testsupport::CServiceProcess host(status.dwProcessId);
        EXPECT_NE(std::wstring::npos, host.ImageName().find(wszHostImage));
        return status.dwProcessId;
    }

    // Clients on the real pipes; a stop with all of them connected drains them.
    void ServeAndStopWithClients(const wchar_t *wszHostImage, size_t cActivities)
    {
        DWORD dwProcessId = StartIn(wszHostImage);
        testsupport::CServiceProcess host(dwProcessId);
        ASSERT_TRUE(host.Opened());

        GUID collectorId = NewGuid();
        CCollectorThread collector(c_wszTelvaneCollectorPipe, collectorId, "{\"host\":1}");
        ASSERT_TRUE(collector.WaitRegistered());

        // One run from start to end while the collector is there.
        GUID logDone = NewGuid();
        GUID eventId = NewGuid();
        m_rgLogIds.push_back(logDone);
        {
            CActivityClient client(c_dwWaitMs);
            ASSERT_EQ(S_OK, client.Connect(c_wszTelvaneActivityPipe));
            ASSERT_EQ(S_OK, client.Start(NewGuid(), logDone));
            ASSERT_EQ(S_OK, client.SendEvent(eventId, "\"done\"", 6));
            ASSERT_TRUE(collector.WaitRequests(1));
            ASSERT_EQ(S_OK, client.Stop());
        }
        std::vector<DeliveredLog> rgDone = WaitForLogs(logDone, 1);
        ASSERT_EQ(1u, rgDone.size());
        EXPECT_EQ((std::vector<std::string>{"\"done\""}), GroupValues(*rgDone[0].doc, eventId));
        EXPECT_EQ((std::vector<std::string>{"{\"host\":1}"}),
                  GroupValues(*rgDone[0].doc, collectorId));

        // Then many runs still going when the stop comes.
        std::vector<std::unique_ptr<CActivityClient>> rgClients;
        std::vector<GUID> rgLogIds;
        for (size_t i = 0; i < cActivities; i++)
        {
            rgLogIds.push_back(NewGuid());
            m_rgLogIds.push_back(rgLogIds.back());
            rgClients.emplace_back(new CActivityClient(c_dwWaitMs));
            ASSERT_EQ(S_OK, rgClients.back()->Connect(c_wszTelvaneActivityPipe));
            ASSERT_EQ(S_OK, rgClients.back()->Start(NewGuid(), rgLogIds.back()));
            ASSERT_EQ(S_OK, rgClients.back()->SendEvent(eventId, "1", 1));
        }
        ASSERT_TRUE(collector.WaitRequests(1 + cActivities, 120000));

        EXPECT_EQ(0u, testsupport::ServiceStop(c_wszTelvane));
        SERVICE_STATUS_PROCESS status = {};
        EXPECT_TRUE(testsupport::ServiceWaitForState(c_wszTelvane, SERVICE_STOPPED, 120000, &status));
        EXPECT_EQ(0u, status.dwWin32ExitCode);
        // A clean exit: the unload check found nothing left (a failed check ends the host with
        // a fail-fast code).
        EXPECT_EQ(0u, host.WaitForExitCode(c_dwStateWaitMs));
        for (const GUID &logId : rgLogIds)
        {
            std::vector<DeliveredLog> rgLogs = LogsOf(logId);
            ASSERT_EQ(1u, rgLogs.size());
            EXPECT_TRUE((*rgLogs[0].doc)["LogEnd"].GetBool());
        }
    }

    std::vector<GUID> m_rgLogIds;
};
} // namespace

TEST_F(CoreScm, ServesAndDrainsUnderSvchost)
{
    ServeAndStopWithClients(L"svchost.exe", 100);
}

TEST_F(CoreScm, ServesAndDrainsUnderTelvaneHost)
{
    UseTelvaneHost();
    ServeAndStopWithClients(L"telvanehost.exe", 100);
}

TEST_F(CoreScm, StartBesideASquatterIsRefusedWithoutHarm)
{
    HANDLE hSquat =
        CreateNamedPipeW(c_wszTelvaneActivityPipe, PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED,
                         PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE, 1, 1024, 1024, 0, nullptr);
    ASSERT_NE(INVALID_HANDLE_VALUE, hSquat);
    // Wine's control manager answers 1053 when STOPPED comes before RUNNING.
    DWORD dwStart = testsupport::ServiceStart(c_wszTelvane, {});
    EXPECT_TRUE(dwStart == 0 || dwStart == ERROR_SERVICE_REQUEST_TIMEOUT) << dwStart;
    SERVICE_STATUS_PROCESS status = {};
    EXPECT_TRUE(testsupport::ServiceWaitForState(c_wszTelvane, SERVICE_STOPPED, c_dwStateWaitMs, &status));
    EXPECT_EQ(static_cast<DWORD>(ERROR_ALREADY_EXISTS), status.dwWin32ExitCode);
    // The collector pipe was never made: nothing of the service listens.
    EXPECT_FALSE(WaitNamedPipeW(c_wszTelvaneCollectorPipe, 1));
    EXPECT_EQ(static_cast<DWORD>(ERROR_FILE_NOT_FOUND), GetLastError());
    CloseHandle(hSquat);

    // Once the name is free the service starts as usual.
    StartIn(L"svchost.exe");
    EXPECT_EQ(0u, testsupport::ServiceStop(c_wszTelvane));
    EXPECT_TRUE(testsupport::ServiceWaitForState(c_wszTelvane, SERVICE_STOPPED, c_dwStateWaitMs));
}
