#include "tests/pipe/testpipeserver.h"

namespace pipetest
{
CTestPipeServer::CTestPipeServer(bool fCollector)
    : m_fCollector(fCollector)
    , m_pPipe(nullptr)
    , m_cVersionReplies(0)
    , m_fRegistered(false)
    , m_fEnded(false)
    , m_activityId()
    , m_logId()
    , m_collectorId()
{
}

CTestPipeServer::~CTestPipeServer()
{
    if (m_pPipe != nullptr)
    {
        m_pPipe->Release();
    }
}

CTestPipeServer *CTestPipeServer::Start(bool fCollector, const std::wstring &name)
{
    CTestPipeServer *pServer = new CTestPipeServer(fCollector);
    pServer->Listen(name);
    return pServer;
}

void CTestPipeServer::Listen(const std::wstring &name)
{
    m_pPipe = new AsyncPipe();
    m_pPipe->Listen(name.c_str(), this, this);
}

void CTestPipeServer::SendStartCollection(const GUID &activityId, const GUID &logId)
{
    uint8_t rgb[sizeof(TELVANE_START_COLLECTION)];
    PipeCodecEncodeStartCollection(WireGuid(activityId), WireGuid(logId), rgb);
    m_pPipe->Write(rgb, sizeof(rgb));
}

void CTestPipeServer::Shutdown()
{
    m_pPipe->Close();
    WaitForRefs(1);
    WaitForPipeRefs(m_pPipe, 1);
}

void CTestPipeServer::Finish()
{
    Shutdown();
    Release();
}

void CTestPipeServer::OnConnected()
{
    uint8_t rgb[sizeof(TELVANE_VERSION_NEGOTIATE)];
    PipeCodecEncodeVersion(rgb);
    m_pPipe->Write(rgb, sizeof(rgb));
}

void CTestPipeServer::Fault(const char *szFault)
{
    Record([&] { m_rgFaults.push_back(szFault); });
    m_pPipe->Close();
}

void CTestPipeServer::OnMessage(const BYTE *pb, ULONG cb)
{
    Record([&] { m_rgMessages.emplace_back(pb, pb + cb); });
    PIPE_MESSAGE message;
    if (m_fCollector)
    {
        PipeCodecDecodeCollector(pb, cb, &message);
    }
    else
    {
        PipeCodecDecodeActivity(pb, cb, &message);
    }
    if (message.szFault != nullptr)
    {
        Fault(message.szFault);
        return;
    }
    switch (message.kind)
    {
    case PipeMessageVersion:
        Record([&] { m_cVersionReplies++; });
        break;
    case PipeMessageStartActivity:
        Record([&] {
            m_activityId = message.ActivityID;
            m_logId = message.LogID;
        });
        break;
    case PipeMessageRegisterCollector:
        Record([&] {
            m_collectorId = message.CollectorID;
            m_fRegistered = true;
        });
        break;
    case PipeMessageActivityEvent:
    case PipeMessageCollectionComplete:
        switch (m_reassembly.AddPart(message.pbPayload, message.cbPayload, message.fComplete))
        {
        case PipePartMore:
            break;
        case PipePartComplete:
            Record([&] { m_rgItems.push_back({message.EventID, m_reassembly.Take()}); });
            break;
        case PipePartTooLarge:
            Fault(m_fCollector ? c_szPipeFaultCollectorResultTooLarge
                               : c_szPipeFaultActivityEventTooLarge);
            break;
        case PipePartOverBudget: // this server has no budget
            break;
        }
        break;
    default:
        Record([&] { m_fEnded = true; });
        m_pPipe->Close();
        break;
    }
}

bool CTestPipeServer::WaitForItems(size_t c, DWORD dwTimeoutMs)
{
    return WaitUntil([&] { return m_rgItems.size() >= c; }, dwTimeoutMs);
}

bool CTestPipeServer::WaitForRegistration(DWORD dwTimeoutMs)
{
    return WaitUntil([&] { return m_fRegistered; }, dwTimeoutMs);
}

bool CTestPipeServer::WaitForEnd(DWORD dwTimeoutMs)
{
    return WaitUntil([&] { return m_fEnded; }, dwTimeoutMs);
}

std::vector<ReceivedItem> CTestPipeServer::Items() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_rgItems;
}

std::vector<std::string> CTestPipeServer::Faults() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_rgFaults;
}

int CTestPipeServer::VersionReplies() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_cVersionReplies;
}

TELVANE_GUID CTestPipeServer::ActivityID() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_activityId;
}

TELVANE_GUID CTestPipeServer::LogID() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_logId;
}

TELVANE_GUID CTestPipeServer::CollectorID() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_collectorId;
}
} // namespace pipetest
