#include "tests/common/policyserver.h"

#include <stdio.h>
#include <fstream>
#include <sstream>

namespace
{
// How long a server may take to start listening (Python's start under load).
const DWORD c_dwStartLimitMs = 60000;
const DWORD c_dwPollMs = 20;

std::string RunDir()
{
    return TELVANE_HTTPS_DIR "/run";
}
} // namespace

std::string CTestPolicyServer::PkiPath(const char *szFile)
{
    return std::string(TELVANE_HTTPS_DIR "/pki/") + szFile;
}

std::wstring CTestPolicyServer::WindowsPath(const std::string &strLinuxPath)
{
    std::wstring wstr = L"Z:";
    for (char ch : strLinuxPath)
    {
        wstr.push_back(ch == '/' ? L'\\' : static_cast<wchar_t>(static_cast<unsigned char>(ch)));
    }
    return wstr;
}

std::wstring CTestPolicyServer::Url(USHORT usPort, const char *szScheme)
{
    std::string strUrl =
        std::string(szScheme) + "://localhost:" + std::to_string(usPort) + "/v1/api/config/udpecho";
    return std::wstring(strUrl.begin(), strUrl.end());
}

bool CTestPolicyServer::Start(const PolicyServerOptions &options)
{
    std::string strRun = RunDir();
    CreateDirectoryW(WindowsPath(TELVANE_HTTPS_DIR).c_str(), nullptr);
    CreateDirectoryW(WindowsPath(strRun).c_str(), nullptr);
    std::string strBase = strRun + "/" + std::to_string(options.usPort);
    std::string strReady = strBase + ".ready";
    m_strLog = strBase + ".log";
    DeleteFileW(WindowsPath(strReady).c_str());
    DeleteFileW(WindowsPath(m_strLog).c_str());

    std::ostringstream cmd;
    cmd << TELVANE_PYTHON3 " " TELVANE_POLICY_SERVER " --port " << options.usPort << " --cert "
        << PkiPath(options.fRogueCertificate ? "roguesrv.pem" : "server.pem") << " --key "
        << PkiPath(options.fRogueCertificate ? "roguesrv.key" : "server.key") << " --client-ca "
        << PkiPath("ca.pem") << " --status " << options.iStatus << " --chunks " << options.cChunks
        << " --requests " << options.cRequests << " --lifetime " << options.cLifetimeSeconds
        << " --ready " << strReady << " --log " << m_strLog;
    if (options.cbPadTo != 0)
    {
        cmd << " --pad-to " << options.cbPadTo;
    }
    else if (options.fUseBody)
    {
        // Through a file: a body may hold quotes and spaces that a command line would mangle.
        std::string strBodyFile = strBase + ".body";
        std::ofstream body(WindowsPath(strBodyFile).c_str(), std::ios::binary | std::ios::trunc);
        body << options.strBody;
        body.close();
        cmd << " --body-file " << strBodyFile;
    }

    std::wstring wstrCommand = WindowsPath(TELVANE_PYTHON3);
    std::string strArgs = cmd.str().substr(sizeof(TELVANE_PYTHON3) - 1);
    wstrCommand += std::wstring(strArgs.begin(), strArgs.end());
    STARTUPINFOW si = {};
    si.cb = sizeof(si);
    PROCESS_INFORMATION pi = {};
    if (!CreateProcessW(nullptr, &wstrCommand[0], nullptr, nullptr, FALSE, 0, nullptr, nullptr, &si,
                        &pi))
    {
        return false;
    }
    // Wine hands a Linux program over and reports it gone at once: only the ready file
    // says that it listens.
    CloseHandle(pi.hThread);
    CloseHandle(pi.hProcess);
    std::wstring wstrReady = WindowsPath(strReady);
    for (DWORD dwWaited = 0; dwWaited < c_dwStartLimitMs; dwWaited += c_dwPollMs)
    {
        if (GetFileAttributesW(wstrReady.c_str()) != INVALID_FILE_ATTRIBUTES)
        {
            return true;
        }
        Sleep(c_dwPollMs);
    }
    return false;
}

std::vector<std::string> CTestPolicyServer::Requests() const
{
    std::vector<std::string> rgLines;
    std::ifstream log(WindowsPath(m_strLog).c_str());
    std::string strLine;
    while (std::getline(log, strLine))
    {
        rgLines.push_back(strLine);
    }
    return rgLines;
}
