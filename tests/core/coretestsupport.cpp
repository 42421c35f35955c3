#include "tests/core/coretestsupport.h"
#include "service/cserviceactivity.h"
#include "service/cservicecollector.h"
#include "service/cserviceoperation.h"
#include "servicelib/eventtrace.h"
#include "servicelib/reghelper.h"

#include <rapidjson/error/en.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>
#include <rpc.h>

#include <algorithm>

namespace coretest
{
namespace
{
const wchar_t c_wszCrowdsourcingKey[] =
    L"System\\CurrentControlSet\\Services\\Ambrel\\Parameters\\CrowdsrcPlugin";
const wchar_t c_wszTelvaneParametersKey[] =
    L"System\\CurrentControlSet\\Services\\Telvane\\Parameters";
const wchar_t c_wszLogDirectory[] = L"C:\\Data\\Test\\WiFiLog";

struct TraceLine
{
    USHORT usId;
    std::string strText;
};

std::mutex s_traceLock;
std::vector<TraceLine> s_rgTraceLines;

void CaptureWrite(REGHANDLE, const EVENT_DESCRIPTOR *pDescriptor, ULONG cData,
                  const EVENT_DATA_DESCRIPTOR *pData)
{
    TraceLine line = {pDescriptor->Id, std::string()};
    if (cData > 0 && pData[0].Size > 0)
    {
        // The text is written with its terminator.
        line.strText.assign(reinterpret_cast<const char *>(pData[0].Ptr), pData[0].Size - 1);
    }
    std::lock_guard<std::mutex> guard(s_traceLock);
    s_rgTraceLines.push_back(line);
}

std::string ReadWholeFile(const std::wstring &wstrPath)
{
    std::string str;
    HANDLE hFile = CreateFileW(wstrPath.c_str(), GENERIC_READ, FILE_SHARE_READ | FILE_SHARE_DELETE,
                               nullptr, OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL, nullptr);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return str;
    }
    char rgch[65536];
    DWORD cbRead = 0;
    while (ReadFile(hFile, rgch, sizeof(rgch), &cbRead, nullptr) && cbRead != 0)
    {
        str.append(rgch, cbRead);
    }
    CloseHandle(hFile);
    return str;
}

std::vector<std::wstring> LogFiles()
{
    std::vector<std::wstring> rg;
    WIN32_FIND_DATAW data;
    HANDLE hFind = FindFirstFileW((std::wstring(c_wszLogDirectory) + L"\\*").c_str(), &data);
    if (hFind == INVALID_HANDLE_VALUE)
    {
        return rg;
    }
    do
    {
        if ((data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY) == 0)
        {
            rg.push_back(std::wstring(c_wszLogDirectory) + L"\\" + data.cFileName);
        }
    } while (FindNextFileW(hFind, &data));
    FindClose(hFind);
    return rg;
}
} // namespace

GUID NewGuid()
{
    GUID guid;
    UuidCreate(&guid);
    return guid;
}

std::string GuidText(const GUID &guid)
{
    return GuidKeyText(guid).Get();
}

bool WaitUntil(const std::function<bool()> &pred, DWORD dwTimeoutMs)
{
    ULONGLONG ullDeadline = GetTickCount64() + dwTimeoutMs;
    while (!pred())
    {
        if (GetTickCount64() >= ullDeadline)
        {
            return false;
        }
        Sleep(5);
    }
    return true;
}

CTraceSession::CTraceSession()
{
    {
        std::lock_guard<std::mutex> guard(s_traceLock);
        s_rgTraceLines.clear();
    }
    TraceSetWriteHook(CaptureWrite);
    Enable(true);
}

CTraceSession::~CTraceSession()
{
    Enable(false);
    TraceSetWriteHook(nullptr);
}

void CTraceSession::Enable(bool fEnable)
{
    TraceProviderEnableCallback(
        &TELVANE_PROVIDER_GUID,
        fEnable ? EVENT_CONTROL_CODE_ENABLE_PROVIDER : EVENT_CONTROL_CODE_DISABLE_PROVIDER,
        fEnable ? 4 : 0, fEnable ? 0x100 : 0, 0, nullptr, &g_TelvaneTraceProvider);
}

std::vector<std::string> CTraceSession::Lines() const
{
    std::lock_guard<std::mutex> guard(s_traceLock);
    std::vector<std::string> rg;
    for (const TraceLine &line : s_rgTraceLines)
    {
        rg.push_back(std::to_string(line.usId) + "|" + line.strText);
    }
    return rg;
}

size_t CTraceSession::Count(const std::string &text) const
{
    std::lock_guard<std::mutex> guard(s_traceLock);
    return static_cast<size_t>(
        std::count_if(s_rgTraceLines.begin(), s_rgTraceLines.end(),
                      [&](const TraceLine &l) { return l.strText == text; }));
}

bool CTraceSession::WaitFor(const std::string &text, size_t c, DWORD dwTimeoutMs) const
{
    return WaitUntil([&] { return Count(text) >= c; }, dwTimeoutMs);
}

void EnableFileDelivery()
{
    // The service makes only the last folder of the log directory.
    CreateDirectoryW(L"C:\\Data", nullptr);
    CreateDirectoryW(L"C:\\Data\\Test", nullptr);
    RegHelperSetDword(c_wszCrowdsourcingKey, L"EnableWifiCrowdsourcing", 3);
    RegHelperSetDword(c_wszTelvaneParametersKey, L"EnableTestLogging", 1);
}

std::vector<DeliveredLog> LogsOf(const GUID &logId)
{
    std::string strLogId = GuidText(logId);
    std::vector<DeliveredLog> rgLogs;
    for (const std::wstring &wstrPath : LogFiles())
    {
        std::string strText = ReadWholeFile(wstrPath);
        if (strText.find(strLogId) == std::string::npos)
        {
            continue;
        }
        auto doc = std::make_shared<rapidjson::Document>();
        // Strict: exactly one JSON value, nothing after it, no comments, no extensions.
        doc->Parse<rapidjson::kParseValidateEncodingFlag>(strText.c_str(), strText.size());
        if (doc->HasParseError())
        {
            ADD_FAILURE() << "not JSON (" << rapidjson::GetParseError_En(doc->GetParseError())
                          << " at " << doc->GetErrorOffset() << "): " << strText.substr(0, 300);
            continue;
        }
        if (!doc->IsObject() || !doc->HasMember("LogID") || !(*doc)["LogID"].IsString() ||
            strLogId != (*doc)["LogID"].GetString())
        {
            continue;
        }
        rgLogs.push_back(DeliveredLog{wstrPath, doc});
    }
    std::sort(rgLogs.begin(), rgLogs.end(), [](const DeliveredLog &a, const DeliveredLog &b) {
        return (*a.doc)["LogCount"].GetUint() < (*b.doc)["LogCount"].GetUint();
    });
    return rgLogs;
}

std::vector<DeliveredLog> WaitForLogs(const GUID &logId, size_t c, DWORD dwTimeoutMs)
{
    std::vector<DeliveredLog> rgLogs;
    WaitUntil(
        [&] {
            rgLogs = LogsOf(logId);
            return rgLogs.size() >= c;
        },
        dwTimeoutMs);
    return rgLogs;
}

void DeleteLogsOf(const GUID &logId)
{
    for (const DeliveredLog &log : LogsOf(logId))
    {
        DeleteFileW(log.wstrPath.c_str());
    }
}

std::string JsonText(const rapidjson::Value &value)
{
    rapidjson::StringBuffer buffer;
    rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
    value.Accept(writer);
    return buffer.GetString();
}

std::vector<std::string> GroupValues(const rapidjson::Value &log, const GUID &id)
{
    std::vector<std::string> rg;
    std::string strKey = "ID" + GuidText(id);
    auto it = log.FindMember(strKey.c_str());
    if (it == log.MemberEnd() || !it->value.IsArray())
    {
        return rg;
    }
    for (const rapidjson::Value &record : it->value.GetArray())
    {
        EXPECT_TRUE(record.IsObject() && record.HasMember("TimeStamp") && record.HasMember("Value"))
            << JsonText(record);
        if (record.IsObject() && record.HasMember("Value"))
        {
            rg.push_back(JsonText(record["Value"]));
        }
    }
    return rg;
}

CCollectorThread::CCollectorThread(const std::wstring &wstrPipe, const GUID &collectorId,
                                   std::string strResult, size_t cRequests)
    : m_wstrPipe(wstrPipe)
    , m_collectorId(collectorId)
    , m_strResult(std::move(strResult))
    , m_cRequests(cRequests)
    , m_fRegistered(false)
    , m_fEnded(false)
    , m_fStop(false)
    , m_fHold(false)
    , m_fVanish(false)
    , m_thread([this] { Run(); })
{
}

CCollectorThread::~CCollectorThread()
{
    Stop();
}

void CCollectorThread::Run()
{
    CCollectorClient client(pipetest::c_dwWaitMs);
    if (SUCCEEDED(client.Connect(m_wstrPipe.c_str())) && SUCCEEDED(client.Register(m_collectorId)))
    {
        m_fRegistered = true;
        size_t cAnswered = 0;
        while (!m_fStop && !m_fVanish && (m_cRequests == 0 || cAnswered < m_cRequests))
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
            while (m_fHold && !m_fStop && !m_fVanish)
            {
                Sleep(5);
            }
            if (m_fVanish || m_fStop)
            {
                break;
            }
            if (FAILED(client.SendResult(m_strResult.data(), m_strResult.size())))
            {
                break;
            }
            cAnswered++;
        }
        if (!m_fVanish && !m_fStop && m_cRequests != 0)
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

bool CCollectorThread::WaitEnded(DWORD dwTimeoutMs)
{
    return WaitUntil([&] { return m_fEnded.load(); }, dwTimeoutMs);
}

std::vector<GUID> CCollectorThread::RequestLogIds() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_rgLogIds;
}

void CCollectorThread::Hold()
{
    m_fHold = true;
}

void CCollectorThread::Release()
{
    m_fHold = false;
}

void CCollectorThread::Vanish()
{
    m_fVanish = true;
    if (m_thread.joinable())
    {
        m_thread.join();
    }
}

void CCollectorThread::Stop()
{
    m_fStop = true;
    if (m_thread.joinable())
    {
        m_thread.join();
    }
}

void CCoreTest::SetUp()
{
    EnableFileDelivery();
    m_wstrActivityPipe = pipetest::UniquePipeName(L"coreact");
    m_wstrCollectorPipe = pipetest::UniquePipeName(L"corecol");
    m_pService.reset(new CTestCoordinator(m_wstrActivityPipe.c_str(), m_wstrCollectorPipe.c_str()));
    Start();
}

void CCoreTest::Start()
{
    m_pService->OnStart();
    ASSERT_TRUE(WaitUntil([&] { return m_pService->State() == SERVICE_RUNNING; }))
        << m_pService->State();
}

void CCoreTest::Stop()
{
    if (m_fStopped)
    {
        return;
    }
    m_fStopped = true;
    m_pService->OnStop();
    EXPECT_EQ(static_cast<DWORD>(SERVICE_STOPPED), m_pService->State());
    // Everything the coordinator made is gone, and it holds no reference of its own.
    EXPECT_TRUE(WaitUntil([] {
        return CServiceActivity::LiveCount() == 0 && CServiceCollector::LiveCount() == 0 &&
               CServiceOperation::LiveCount() == 0;
    })) << CServiceActivity::LiveCount()
        << " activities, " << CServiceCollector::LiveCount() << " collectors, "
        << CServiceOperation::LiveCount() << " operations left";
    for (ULONG ulTag = 1; ulTag < c_cServiceTags; ulTag++)
    {
        EXPECT_EQ(0, m_pService->TagCount(ulTag)) << "coordinator tag " << ulTag;
    }
}

void CCoreTest::TearDown()
{
    Stop();
    m_pService.reset();
    for (const GUID &logId : m_rgLogIds)
    {
        DeleteLogsOf(logId);
    }
    for (const std::wstring &line : m_failures.Lines())
    {
        ADD_FAILURE() << testsupport::Narrow(line);
    }
}

std::unique_ptr<CActivityClient> CCoreTest::StartActivity(const GUID &activityId, const GUID &logId)
{
    m_rgLogIds.push_back(logId);
    std::unique_ptr<CActivityClient> client(new CActivityClient(pipetest::c_dwWaitMs));
    EXPECT_EQ(S_OK, client->Connect(m_wstrActivityPipe.c_str()));
    EXPECT_EQ(S_OK, client->Start(activityId, logId));
    return client;
}

void CCoreTest::RunActivity(const GUID &activityId, const GUID &logId,
                            const std::vector<std::pair<GUID, std::string>> &rgEvents)
{
    std::unique_ptr<CActivityClient> client = StartActivity(activityId, logId);
    for (const auto &event : rgEvents)
    {
        EXPECT_EQ(S_OK, client->SendEvent(event.first, event.second.data(), event.second.size()));
    }
    EXPECT_EQ(S_OK, client->Stop());
}
} // namespace coretest
