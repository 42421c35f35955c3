// Starts the local TLS policy service (policyserver.py, a Linux program that Wine starts
// directly) for one test and reads what it saw. Used on the test's main thread.
#pragma once

#include <windows.h>
#include <string>
#include <vector>

struct PolicyServerOptions
{
    USHORT usPort = 0;
    int iStatus = 200;
    std::string strBody;            // empty: the server's default policy (see fUseBody)
    bool fUseBody = false;          // true: answer strBody, even when empty
    unsigned cChunks = 0;           // 0: Content-Length; else chunked in this many pieces
    size_t cbPadTo = 0;             // non-zero: an object padded to exactly this size
    bool fRogueCertificate = false; // serve a localhost certificate from an untrusted CA
    unsigned cRequests = 1;
    unsigned cLifetimeSeconds = 30;
};

class CTestPolicyServer
{
public:
    // Starts the server and waits until it listens; false when it did not come up.
    bool Start(const PolicyServerOptions &options);

    // One entry per request the server answered: the JSON line it logged.
    std::vector<std::string> Requests() const;

    static std::string PkiPath(const char *szFile); // Linux path of a test certificate
    static std::wstring WindowsPath(const std::string &strLinuxPath); // Z:\... form
    static std::wstring Url(USHORT usPort, const char *szScheme = "https");

private:
    std::string m_strLog;
};
