// Helpers of the UDP test suites: a trace session that records the events of the main
// provider as text, and the prefix's policy folder and test application.
#pragma once

#include <windows.h>
#include <string>
#include <vector>

namespace udptest
{
// Acts as a trace session with every keyword of the main provider while it lives. Events
// are recorded as "id", "id|text" or "id|text|code" (code in hex), payload terminators
// dropped; wide payloads are narrowed. One session at a time.
class TraceSession
{
public:
    TraceSession();
    ~TraceSession();
    std::vector<std::string> Lines() const;
    bool Contains(const std::string &strLine) const;
};

// Reads a whole file; false when it cannot be opened.
bool ReadWholeFile(const std::wstring &wstrPath, std::string *pstrText);
bool WriteWholeFile(const std::wstring &wstrPath, const std::string &strText);

// Creates the policy folder (as the install steps do) and removes the policy file and its
// temporary twin, so each test starts without a policy.
void PreparePolicyFolder();
} // namespace udptest

namespace udptest
{
// Where the service finds the test application, and where the application writes results.
extern const wchar_t c_wszTestAppPath[];
extern const wchar_t c_wszResultFolder[];

// Installs the built test application into the prefix as the install steps do (the program
// folder and the policy folder), and empties its result folder.
void InstallTestApplication();
// The result files in the result folder.
std::vector<std::wstring> ResultFiles();

// Runs telvanectl.exe with the arguments; returns its exit code (its output on failure goes
// into the test's messages).
DWORD RunTelvanectl(const std::wstring &wstrArguments, std::string *pstrOutput = nullptr);

// A UDP echo relay process on 127.0.0.1:port that ends by itself when idle for a few seconds;
// the constructor returns once it listens.
class RelayProcess
{
public:
    RelayProcess(unsigned short usPort, const std::wstring &wstrExtraArguments = L"");
    ~RelayProcess();
    bool Listening() const { return m_fListening; }
    // Waits (bounded) for the relay to end and returns its report line.
    std::string WaitForReport();

private:
    HANDLE m_hProcess = nullptr;
    bool m_fListening = false;
    std::wstring m_wstrReport;
};
} // namespace udptest
