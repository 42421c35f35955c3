// The UDP echo test's side of the prefix: the policy folder, the test application installed
// as the README's steps install it, and a loopback echo relay process. Used on the test thread.
#pragma once

#include "inc/handleholder.h"

#include <windows.h>
#include <string>
#include <vector>

namespace testsupport
{
// Where the service finds the test application, and where the application writes results.
extern const wchar_t c_wszTestAppPath[];
extern const wchar_t c_wszResultFolder[];

// Creates the policy folder (as the install steps do) and removes the policy file and its
// temporary twin, so each test starts without a policy.
void PreparePolicyFolder();
// Installs the built test application into the prefix (the program folder and the policy
// folder), and empties its result folder.
void InstallTestApplication();
// The result files in the result folder.
std::vector<std::wstring> ResultFiles();

// A UDP echo relay process on 127.0.0.1:port that ends by itself when idle for a few seconds;
// the constructor returns once it listens.
class CRelayProcess
{
public:
    CRelayProcess(unsigned short usPort, const std::wstring &wstrExtraArguments = L"");
    ~CRelayProcess();
    bool Listening() const { return m_fListening; }
    // Waits (bounded) for the relay to end and returns its report line.
    std::string WaitForReport();

private:
    CKernelHandle m_process;
    bool m_fListening = false;
    std::wstring m_wstrReport;
};
} // namespace testsupport
