#include "tests/common/policyserver.h"
#include "tests/common/testsupport.h"

#include <stdio.h>
#include <fstream>
#include <sstream>

namespace
{
// How long a server may take to start listening (Python's start under load).
const DWORD c_dwStartLimitMs = 60000;

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
    return testsupport::Widen(std::string(szScheme) + "://localhost:" + std::to_string(usPort) +
                              "/v1/api/config/udpecho");
}

bool CTestPolicyServer::Start(const PolicyServerOptions &options)
{
    std::string strRun = RunDir();
    testsupport::CreateFolders(WindowsPath(strRun));
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
        testsupport::WriteFileText(WindowsPath(strBodyFile), options.strBody);
        cmd << " --body-file " << strBodyFile;
    }

    std::wstring wstrCommand = WindowsPath(TELVANE_PYTHON3) +
                               testsupport::Widen(cmd.str().substr(sizeof(TELVANE_PYTHON3) - 1));
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
    return testsupport::WaitUntil(
        [&] { return GetFileAttributesW(wstrReady.c_str()) != INVALID_FILE_ATTRIBUTES; },
        c_dwStartLimitMs);
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
