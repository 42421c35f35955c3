// udprelay.exe: a UDP echo relay for the tests and the demo. It answers every datagram on
// 127.0.0.1:PORT with the same bytes, and ends by itself: after its lifetime, after a quiet
// spell, or after a number of packets. Runs on its main thread only.
//
//   udprelay.exe -port PORT [-lifetime S] [-idle S] [-packets N] [-drop N] [-ready EVENT]
//                [-report FILE]
//
// -drop N leaves every Nth datagram unanswered (to show losses); -ready names an event it
// sets once it listens; -report receives the final counts. Exit code 0, or 1 when it could
// not listen, 2 on bad arguments.
#include <winsock2.h>
#include <ws2tcpip.h>
#include <windows.h>

#include <stdio.h>
#include <string>

namespace
{
const DWORD c_dwMaxLifetimeS = 600;
const DWORD c_dwDefaultLifetimeS = 60;
const DWORD c_dwDefaultIdleS = 10;
const DWORD c_dwDefaultPackets = 200000;

struct RelayOptions
{
    DWORD dwPort = 0;
    DWORD dwLifetimeS = c_dwDefaultLifetimeS;
    DWORD dwIdleS = c_dwDefaultIdleS;
    DWORD dwPackets = c_dwDefaultPackets;
    DWORD dwDrop = 0;
    std::wstring wstrReady;
    std::wstring wstrReport;
};

bool RelayParseNumber(const wchar_t *wsz, DWORD dwMin, DWORD dwMax, DWORD *pdw)
{
    ULONGLONG ull = 0;
    const wchar_t *pwch = wsz;
    for (; *pwch >= L'0' && *pwch <= L'9'; pwch++)
    {
        ull = ull * 10 + static_cast<ULONGLONG>(*pwch - L'0');
        if (ull > dwMax)
        {
            return false;
        }
    }
    if (pwch == wsz || *pwch != L'\0' || ull < dwMin)
    {
        return false;
    }
    *pdw = static_cast<DWORD>(ull);
    return true;
}

const char *RelayParseOptions(int argc, wchar_t **argv, RelayOptions *pOptions)
{
    for (int i = 1; i < argc; i++)
    {
        std::wstring arg = argv[i];
        if (i + 1 >= argc)
        {
            return "every option takes a value";
        }
        const wchar_t *wszValue = argv[++i];
        bool fOk = true;
        if (arg == L"-port")
        {
            fOk = RelayParseNumber(wszValue, 1, 65535, &pOptions->dwPort);
        }
        else if (arg == L"-lifetime")
        {
            fOk = RelayParseNumber(wszValue, 1, c_dwMaxLifetimeS, &pOptions->dwLifetimeS);
        }
        else if (arg == L"-idle")
        {
            fOk = RelayParseNumber(wszValue, 1, c_dwMaxLifetimeS, &pOptions->dwIdleS);
        }
        else if (arg == L"-packets")
        {
            fOk = RelayParseNumber(wszValue, 1, 10000000, &pOptions->dwPackets);
        }
        else if (arg == L"-drop")
        {
            fOk = RelayParseNumber(wszValue, 1, 0xFFFFFFFF, &pOptions->dwDrop);
        }
        else if (arg == L"-ready")
        {
            pOptions->wstrReady = wszValue;
        }
        else if (arg == L"-report")
        {
            pOptions->wstrReport = wszValue;
        }
        else
        {
            return "unknown option";
        }
        if (!fOk)
        {
            return "a number is out of range";
        }
    }
    return pOptions->dwPort != 0 ? nullptr : "-port is required";
}

int RelayListen(const RelayOptions &options)
{
    SOCKET s = socket(AF_INET, SOCK_DGRAM, IPPROTO_UDP);
    if (s == INVALID_SOCKET)
    {
        fprintf(stderr, "udprelay: socket failed with %d\n", WSAGetLastError());
        return 1;
    }
    sockaddr_in addr = {};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(static_cast<USHORT>(options.dwPort));
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK); // loopback only, never the network
    if (bind(s, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)) != 0)
    {
        fprintf(stderr, "udprelay: bind to 127.0.0.1:%lu failed with %d\n",
                static_cast<unsigned long>(options.dwPort), WSAGetLastError());
        closesocket(s);
        return 1;
    }
    if (!options.wstrReady.empty())
    {
        HANDLE hReady = OpenEventW(EVENT_MODIFY_STATE, FALSE, options.wstrReady.c_str());
        if (hReady != nullptr)
        {
            SetEvent(hReady);
            CloseHandle(hReady);
        }
    }
    printf("udprelay: listening on 127.0.0.1:%lu\n", static_cast<unsigned long>(options.dwPort));
    fflush(stdout);

    DWORD cReceived = 0;
    DWORD cEchoed = 0;
    const char *szEnd = "lifetime";
    ULONGLONG ullEnd = GetTickCount64() + options.dwLifetimeS * 1000ull;
    ULONGLONG ullIdleEnd = GetTickCount64() + options.dwIdleS * 1000ull;
    char rgb[65536];
    for (;;)
    {
        ULONGLONG ullNow = GetTickCount64();
        if (ullNow >= ullEnd)
        {
            break;
        }
        if (ullNow >= ullIdleEnd)
        {
            szEnd = "idle";
            break;
        }
        if (cReceived >= options.dwPackets)
        {
            szEnd = "packets";
            break;
        }
        ULONGLONG ullWaitMs = (ullEnd < ullIdleEnd ? ullEnd : ullIdleEnd) - ullNow;
        fd_set readable;
        FD_ZERO(&readable);
        FD_SET(s, &readable);
        timeval tv = {static_cast<long>(ullWaitMs / 1000),
                      static_cast<long>((ullWaitMs % 1000) * 1000)};
        int iReady = select(0, &readable, nullptr, nullptr, &tv);
        if (iReady <= 0)
        {
            continue;
        }
        sockaddr_storage from = {};
        int cbFrom = sizeof(from);
        int cb = recvfrom(s, rgb, sizeof(rgb), 0, reinterpret_cast<sockaddr *>(&from), &cbFrom);
        if (cb == SOCKET_ERROR)
        {
            continue; // an unreachable sender of an earlier echo: nothing to answer
        }
        cReceived++;
        ullIdleEnd = GetTickCount64() + options.dwIdleS * 1000ull;
        if (options.dwDrop != 0 && cReceived % options.dwDrop == 0)
        {
            continue;
        }
        if (sendto(s, rgb, cb, 0, reinterpret_cast<sockaddr *>(&from), cbFrom) == cb)
        {
            cEchoed++;
        }
    }
    closesocket(s);

    char szReport[128];
    sprintf_s(szReport, "received %lu echoed %lu end %s\n", static_cast<unsigned long>(cReceived),
              static_cast<unsigned long>(cEchoed), szEnd);
    printf("udprelay: %s", szReport);
    if (!options.wstrReport.empty())
    {
        HANDLE hFile = CreateFileW(options.wstrReport.c_str(), GENERIC_WRITE, 0, nullptr,
                                   CREATE_ALWAYS, 0, nullptr);
        if (hFile != INVALID_HANDLE_VALUE)
        {
            DWORD cbWritten = 0;
            WriteFile(hFile, szReport, static_cast<DWORD>(strlen(szReport)), &cbWritten, nullptr);
            CloseHandle(hFile);
        }
    }
    return 0;
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    RelayOptions options;
    const char *szProblem = RelayParseOptions(argc, argv, &options);
    if (szProblem != nullptr)
    {
        fprintf(stderr,
                "udprelay: %s\nusage: udprelay.exe -port PORT [-lifetime S] [-idle S] "
                "[-packets N] [-drop N] [-ready EVENT] [-report FILE]\n",
                szProblem);
        return 2;
    }
    WSADATA wsa;
    if (WSAStartup(MAKEWORD(2, 2), &wsa) != 0)
    {
        fprintf(stderr, "udprelay: WSAStartup failed\n");
        return 1;
    }
    int iExit = RelayListen(options);
    WSACleanup();
    return iExit;
}
