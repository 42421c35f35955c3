#include "tests/common/udpsupport.h"
#include "service/udptestpolicy.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>

namespace testsupport
{
void PreparePolicyFolder()
{
    CreateFolders(L"C:\\data\\shareddata\\zoriviroruz");
    DeleteFileW(c_wszUdpConfigFile);
    RemoveDirectoryW(c_wszUdpConfigTempFile); // a test may have left a folder in its place
    DeleteFileW(c_wszUdpConfigTempFile);
    ASSERT_EQ(INVALID_FILE_ATTRIBUTES, GetFileAttributesW(c_wszUdpConfigFile));
}

const wchar_t c_wszTestAppPath[] = L"C:\\programs\\zoriviroruz\\ZoRiVirOruz.exe";
const wchar_t c_wszResultFolder[] = L"C:\\data\\shareddata\\zoriviroruz\\results";

void InstallTestApplication()
{
    CreateFolders(L"C:\\programs\\zoriviroruz");
    CreateFolders(L"C:\\data\\shareddata\\zoriviroruz");
    std::wstring wstrBuilt = BinDir() + L"ZoRiVirOruz.exe";
    ASSERT_TRUE(CopyFileW(wstrBuilt.c_str(), c_wszTestAppPath, FALSE)) << GetLastError();
    for (const std::wstring &wstrFile : ResultFiles())
    {
        DeleteFileW(wstrFile.c_str());
    }
}

std::vector<std::wstring> ResultFiles()
{
    std::vector<std::wstring> rgFiles = FileNames(c_wszResultFolder, L"*.json");
    for (std::wstring &wstrFile : rgFiles)
    {
        wstrFile = std::wstring(c_wszResultFolder) + L"\\" + wstrFile;
    }
    return rgFiles;
}

CRelayProcess::CRelayProcess(unsigned short usPort, const std::wstring &wstrExtraArguments)
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
    std::wstring wstrCommand = L"\"" + BinDir() + L"udprelay.exe\" -port " +
                               std::to_wstring(usPort) + L" -idle 3 -lifetime 120 -ready " +
                               wszEvent + L" -report \"" + m_wstrReport + L"\" " +
                               wstrExtraArguments;
    STARTUPINFOW si = {sizeof(si)};
    PROCESS_INFORMATION pi = {};
    if (!CreateTestProcess(wstrCommand, FALSE, CREATE_NO_WINDOW, nullptr, &si, &pi))
    {
        ADD_FAILURE() << "CreateProcess " << GetLastError();
        CloseHandle(hReady);
        return;
    }
    CloseHandle(pi.hThread);
    m_process.Reset(pi.hProcess);
    HANDLE rgh[] = {hReady, m_process.Get()};
    m_fListening = WaitForMultipleObjects(2, rgh, FALSE, 30000) == WAIT_OBJECT_0;
    CloseHandle(hReady);
}

CRelayProcess::~CRelayProcess()
{
    // The relay ends by itself once idle; a test that failed early still waits for it.
    if (m_process.IsValid())
    {
        WaitForSingleObject(m_process.Get(), 30000);
    }
    DeleteFileW(m_wstrReport.c_str());
}

std::string CRelayProcess::WaitForReport()
{
    std::string strReport;
    if (!m_process.IsValid() || WaitForSingleObject(m_process.Get(), 60000) != WAIT_OBJECT_0)
    {
        return strReport;
    }
    ReadFileText(m_wstrReport, &strReport);
    return strReport;
}
} // namespace testsupport
