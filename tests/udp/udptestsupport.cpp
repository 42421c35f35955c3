#include "tests/udp/udptestsupport.h"

#include "service/udptestpolicy.h"
#include "servicelib/eventtrace.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <algorithm>
#include <mutex>

namespace udptest
{
namespace
{
std::mutex s_lock;
std::vector<std::string> s_rgLines;

void TraceCapture(REGHANDLE, const EVENT_DESCRIPTOR *pDescriptor, ULONG cData,
                  const EVENT_DATA_DESCRIPTOR *pData)
{
    std::string strLine = std::to_string(pDescriptor->Id);
    for (ULONG i = 0; i < cData; i++)
    {
        const char *pb = reinterpret_cast<const char *>(static_cast<ULONG_PTR>(pData[i].Ptr));
        strLine += '|';
        if (pDescriptor->Id == TelvaneEvent_UdpLaunch.Id)
        {
            const wchar_t *pwch = reinterpret_cast<const wchar_t *>(pb);
            for (size_t ich = 0; ich + 1 < pData[i].Size / sizeof(wchar_t); ich++)
            {
                strLine += static_cast<char>(pwch[ich]);
            }
        }
        else if (i == 1 && pData[i].Size == sizeof(ULONG))
        {
            ULONG ulCode;
            memcpy(&ulCode, pb, sizeof(ulCode));
            char szCode[16];
            sprintf_s(szCode, "%lx", ulCode);
            strLine += szCode;
        }
        else
        {
            strLine.append(pb, pData[i].Size > 0 ? pData[i].Size - 1 : 0);
        }
    }
    std::lock_guard<std::mutex> guard(s_lock);
    s_rgLines.push_back(strLine);
}

void TraceSessionControl(ULONG ulCode)
{
    TraceProviderEnableCallback(&TELVANE_PROVIDER_GUID, ulCode, 0, 0x500, 0, nullptr,
                                &g_TelvaneTraceProvider);
}
} // namespace

TraceSession::TraceSession()
{
    {
        std::lock_guard<std::mutex> guard(s_lock);
        s_rgLines.clear();
    }
    TraceSetWriteHook(TraceCapture);
    TraceSessionControl(EVENT_CONTROL_CODE_ENABLE_PROVIDER);
}

TraceSession::~TraceSession()
{
    TraceSessionControl(EVENT_CONTROL_CODE_DISABLE_PROVIDER);
    TraceSetWriteHook(nullptr);
}

std::vector<std::string> TraceSession::Lines() const
{
    std::lock_guard<std::mutex> guard(s_lock);
    return s_rgLines;
}

bool TraceSession::Contains(const std::string &strLine) const
{
    std::vector<std::string> rgLines = Lines();
    return std::find(rgLines.begin(), rgLines.end(), strLine) != rgLines.end();
}

bool ReadWholeFile(const std::wstring &wstrPath, std::string *pstrText)
{
    HANDLE hFile = CreateFileW(wstrPath.c_str(), GENERIC_READ, FILE_SHARE_READ, nullptr,
                               OPEN_EXISTING, 0, nullptr);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return false;
    }
    pstrText->clear();
    char rgch[4096];
    DWORD cb = 0;
    while (ReadFile(hFile, rgch, sizeof(rgch), &cb, nullptr) && cb != 0)
    {
        pstrText->append(rgch, cb);
    }
    CloseHandle(hFile);
    return true;
}

bool WriteWholeFile(const std::wstring &wstrPath, const std::string &strText)
{
    HANDLE hFile =
        CreateFileW(wstrPath.c_str(), GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS, 0, nullptr);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return false;
    }
    DWORD cb = 0;
    BOOL fOk = WriteFile(hFile, strText.data(), static_cast<DWORD>(strText.size()), &cb, nullptr);
    CloseHandle(hFile);
    return fOk && cb == strText.size();
}

void PreparePolicyFolder()
{
    CreateDirectoryW(L"C:\\data", nullptr);
    CreateDirectoryW(L"C:\\data\\shareddata", nullptr);
    CreateDirectoryW(L"C:\\data\\shareddata\\zoriviroruz", nullptr);
    DeleteFileW(c_wszUdpConfigFile);
    RemoveDirectoryW(c_wszUdpConfigTempFile); // a test may have left a folder in its place
    DeleteFileW(c_wszUdpConfigTempFile);
    ASSERT_EQ(INVALID_FILE_ATTRIBUTES, GetFileAttributesW(c_wszUdpConfigFile));
}
} // namespace udptest

namespace udptest
{
const wchar_t c_wszTestAppPath[] = L"C:\\programs\\zoriviroruz\\ZoRiVirOruz.exe";
const wchar_t c_wszResultFolder[] = L"C:\\data\\shareddata\\zoriviroruz\\results";

void InstallTestApplication()
{
    CreateDirectoryW(L"C:\\programs", nullptr);
    CreateDirectoryW(L"C:\\programs\\zoriviroruz", nullptr);
    CreateDirectoryW(L"C:\\data", nullptr);
    CreateDirectoryW(L"C:\\data\\shareddata", nullptr);
    CreateDirectoryW(L"C:\\data\\shareddata\\zoriviroruz", nullptr);
    std::wstring wstrBuilt = testsupport::BinDir() + L"ZoRiVirOruz.exe";
    ASSERT_TRUE(CopyFileW(wstrBuilt.c_str(), c_wszTestAppPath, FALSE)) << GetLastError();
    for (const std::wstring &wstrFile : ResultFiles())
    {
        DeleteFileW(wstrFile.c_str());
    }
}

std::vector<std::wstring> ResultFiles()
{
    std::vector<std::wstring> rgFiles;
    WIN32_FIND_DATAW data;
    std::wstring wstrPattern = std::wstring(c_wszResultFolder) + L"\\*.json";
    HANDLE hFind = FindFirstFileW(wstrPattern.c_str(), &data);
    if (hFind == INVALID_HANDLE_VALUE)
    {
        return rgFiles;
    }
    do
    {
        rgFiles.push_back(std::wstring(c_wszResultFolder) + L"\\" + data.cFileName);
    } while (FindNextFileW(hFind, &data));
    FindClose(hFind);
    return rgFiles;
}

DWORD RunTelvanectl(const std::wstring &wstrArguments, std::string *pstrOutput)
{
    testsupport::ChildResult result = testsupport::RunChild(
        L"\"" + testsupport::BinDir() + L"telvanectl.exe\" " + wstrArguments, {}, 30000);
    EXPECT_FALSE(result.fTimedOut);
    if (pstrOutput != nullptr)
    {
        *pstrOutput = result.strOutput;
    }
    return result.dwExitCode;
}

RelayProcess::RelayProcess(unsigned short usPort, const std::wstring &wstrExtraArguments)
{
    wchar_t wszEvent[64];
    swprintf_s(wszEvent, L"TelvaneRelayReady-%lu-%u", GetCurrentProcessId(), usPort);
    HANDLE hReady = CreateEventW(nullptr, TRUE, FALSE, wszEvent);
    if (hReady == nullptr)
    {
        ADD_FAILURE() << "CreateEvent " << GetLastError();
        return;
    }
    wchar_t wszReport[MAX_PATH];
    DWORD cch = GetTempPathW(MAX_PATH, wszReport);
    swprintf_s(wszReport + cch, MAX_PATH - cch, L"relay-%lu-%u.txt", GetCurrentProcessId(), usPort);
    m_wstrReport = wszReport;
    DeleteFileW(m_wstrReport.c_str());
    std::wstring wstrCommand = L"\"" + testsupport::BinDir() + L"udprelay.exe\" -port " +
                               std::to_wstring(usPort) + L" -idle 3 -lifetime 120 -ready " +
                               wszEvent + L" -report \"" + m_wstrReport + L"\" " +
                               wstrExtraArguments;
    STARTUPINFOW si = {sizeof(si)};
    PROCESS_INFORMATION pi = {};
    if (!CreateProcessW(nullptr, &wstrCommand[0], nullptr, nullptr, FALSE, CREATE_NO_WINDOW,
                        nullptr, nullptr, &si, &pi))
    {
        ADD_FAILURE() << "CreateProcess " << GetLastError();
        CloseHandle(hReady);
        return;
    }
    CloseHandle(pi.hThread);
    m_hProcess = pi.hProcess;
    HANDLE rgh[] = {hReady, m_hProcess};
    m_fListening = WaitForMultipleObjects(2, rgh, FALSE, 30000) == WAIT_OBJECT_0;
    CloseHandle(hReady);
}

RelayProcess::~RelayProcess()
{
    if (m_hProcess != nullptr)
    {
        // The relay ends by itself once idle; a test that failed early still waits for it.
        WaitForSingleObject(m_hProcess, 30000);
        CloseHandle(m_hProcess);
    }
    DeleteFileW(m_wstrReport.c_str());
}

std::string RelayProcess::WaitForReport()
{
    std::string strReport;
    if (m_hProcess == nullptr || WaitForSingleObject(m_hProcess, 60000) != WAIT_OBJECT_0)
    {
        return strReport;
    }
    ReadWholeFile(m_wstrReport, &strReport);
    return strReport;
}
} // namespace udptest
