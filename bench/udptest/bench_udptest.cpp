// Costs of the UDP test policy under this platform: saving the policy file through a
// temporary name (written, flushed, renamed over the old one) beside writing it in place,
// reading it back, a refresh that fails at once for want of an endpoint, and the
// platform-free duration parser and argument builder. Prints the median time per operation
// of five rounds; never run as a test. Uses the prefix's real policy folder and puts the
// policy found there back at the end. When the endpoint directory already points
// "NetworkConfigWebRole" at a policy service (telvanectl platform endpoint), it also times
// ten refreshes against it, each a new TLS connection with the device certificate.
#include "platform/endpointdirectory/endpointdirectory.h"
#include "service/isoduration.h"
#include "service/udptestcommandline.h"
#include "service/udptestpolicy.h"

#include <algorithm>
#include <chrono>
#include <functional>
#include <stdio.h>
#include <string>
#include <vector>

namespace
{
const int c_cRounds = 5;

double MedianMicroseconds(int cOps, const std::function<void()> &op)
{
    std::vector<double> rgdbl;
    for (int iRound = 0; iRound < c_cRounds; iRound++)
    {
        auto start = std::chrono::steady_clock::now();
        for (int i = 0; i < cOps; i++)
        {
            op();
        }
        std::chrono::duration<double, std::micro> elapsed =
            std::chrono::steady_clock::now() - start;
        rgdbl.push_back(elapsed.count() / cOps);
    }
    std::sort(rgdbl.begin(), rgdbl.end());
    return rgdbl[c_cRounds / 2];
}

// The policy written straight into place, as a single create-and-write would.
void WriteInPlace(const std::string &strText)
{
    HANDLE hFile = CreateFileW(c_wszUdpConfigFile, GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS,
                               FILE_ATTRIBUTE_NORMAL, nullptr);
    DWORD cb = 0;
    WriteFile(hFile, strText.data(), static_cast<DWORD>(strText.size()), &cb, nullptr);
    CloseHandle(hFile);
}

bool ReadFileText(const wchar_t *wszPath, std::string *pstr)
{
    HANDLE hFile = CreateFileW(wszPath, GENERIC_READ, 0, nullptr, OPEN_EXISTING, 0, nullptr);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return false;
    }
    char rgch[4096];
    DWORD cb = 0;
    while (ReadFile(hFile, rgch, sizeof(rgch), &cb, nullptr) && cb != 0)
    {
        pstr->append(rgch, cb);
    }
    CloseHandle(hFile);
    return true;
}
} // namespace

int main()
{
    CreateDirectoryW(L"C:\\data", nullptr);
    CreateDirectoryW(L"C:\\data\\shareddata", nullptr);
    CreateDirectoryW(L"C:\\data\\shareddata\\zoriviroruz", nullptr);
    std::string strKept;
    bool fHadPolicy = ReadFileText(c_wszUdpConfigFile, &strKept);

    UdpTestConfig config;
    ResetUdpConfig(&config);
    config.enabled = true;
    config.relayFqdn = "relay.example.net";
    config.relayPort = 47250;
    config.expiration = 134000000000000000ull;
    config.numPackets = 100;
    config.maxTestDay = 2.0f;
    config.localIp = "192.168.1.20";

    printf("UDP test policy, median of %d rounds\n", c_cRounds);
    double dblSave = MedianMicroseconds(200, [&] { SaveUdpConfig(&config); });
    std::string strText; // the same text as SaveUdpConfig wrote
    ReadFileText(c_wszUdpConfigFile, &strText);
    double dblInPlace = MedianMicroseconds(200, [&] { WriteInPlace(strText); });
    printf("  save, temporary name + flush + rename   %8.1f us\n", dblSave);
    printf("  write in place (for comparison)         %8.1f us\n", dblInPlace);
    SaveUdpConfig(&config);
    UdpTestConfig loaded;
    printf("  load                                    %8.1f us\n",
           MedianMicroseconds(200, [&] { LoadUdpConfig(&loaded); }));
    PWSTR pwszEndpoint = nullptr;
    if (SUCCEEDED(GetServiceEndpoint(c_wszUdpConfigRole, &pwszEndpoint, 0)))
    {
        std::vector<double> rgdbl;
        int cFailed = 0;
        for (int i = 0; i < 10; i++)
        {
            UdpTestConfig refreshed;
            ResetUdpConfig(&refreshed);
            auto start = std::chrono::steady_clock::now();
            RefreshUdpConfig(&refreshed);
            std::chrono::duration<double, std::milli> elapsed =
                std::chrono::steady_clock::now() - start;
            // A failed refresh pushes the expiration out by a week.
            if (refreshed.expiration < UdpConfigNow() + 6000000000000ull)
            {
                rgdbl.push_back(elapsed.count());
            }
            else
            {
                cFailed++;
            }
        }
        std::vector<double> rgdblSorted = rgdbl;
        std::sort(rgdblSorted.begin(), rgdblSorted.end());
        if (rgdbl.empty())
        {
            printf("  refresh against %ls: every one failed\n", pwszEndpoint);
        }
        else
        {
            printf("  refresh against %ls: %zu applied (first %.1f ms, median %.1f ms, "
                   "max %.1f ms), %d failed\n",
                   pwszEndpoint, rgdbl.size(), rgdbl[0], rgdblSorted[rgdbl.size() / 2],
                   rgdblSorted.back(), cFailed);
        }
        ReleaseEndpoint(pwszEndpoint);
    }
    else
    {
        printf("  refresh failing without an endpoint     %8.1f us (includes the save)\n",
               MedianMicroseconds(50, [&] {
                   UdpTestConfig failed;
                   ResetUdpConfig(&failed);
                   RefreshUdpConfig(&failed);
               }));
    }

    DurationParts parts;
    volatile int32_t hrSink = 0;
    printf("  ParseIsoDuration P1W2DT1H30M            %8.3f us\n",
           MedianMicroseconds(100000, [&] { hrSink = ParseIsoDuration("P1W2DT1H30M", &parts); }));
    std::string strArgs;
    printf("  BuildTestCommandLine                    %8.3f us\n",
           MedianMicroseconds(100000, [&] { BuildTestCommandLine(config, strArgs); }));

    if (fHadPolicy)
    {
        WriteInPlace(strKept);
    }
    else
    {
        DeleteFileW(c_wszUdpConfigFile);
    }
    return hrSink == c_hrIsoDurationOk ? 0 : 1;
}
