// ZoRiVirOruz.exe, the UDP echo test: sends numbered packets to an echo relay, counts the
// echoes and their round-trip times, writes one result file per run and exits. The service
// starts it with the arguments of its policy; it runs on its main thread only.
//
//   ZoRiVirOruz.exe [-verbose] [-remoteIP] [-localIP ADDRESS] [-localPort N] [-delay MS]
//                   [-count N] [-size BYTES] [-result FILE] RELAY PORT
//
// Exit codes: 0 the test ran (whatever it measured), 1 it could not run (the result file
// says why), 2 bad arguments.
#include <winsock2.h>
#include <ws2tcpip.h>
#include <windows.h>

#include <algorithm>
#include <stdio.h>
#include <string>
#include <vector>

namespace
{
const int c_iExitOk = 0;
const int c_iExitFailed = 1;
const int c_iExitUsage = 2;

// Defaults match what the service leaves out of the command line.
const DWORD c_dwDefaultDelayMs = 20;
const DWORD c_dwDefaultCount = 500;
const DWORD c_dwDefaultSize = 12;

// Bounds that keep one run short whatever the policy says.
const DWORD c_dwMaxCount = 100000;
const DWORD c_dwMaxDelayMs = 10000;
const DWORD c_dwMaxSize = 65507;            // the largest UDP payload
const ULONGLONG c_ullMaxRunMs = 10 * 60000; // sending stops after ten minutes
const DWORD c_dwDrainMs = 2000;             // how long echoes may trail the last packet

const wchar_t c_wszResultFolder[] = L"C:\\data\\shareddata\\zoriviroruz\\results";
// Result files kept in that folder: a phone runs the test for years, so the oldest go.
const size_t c_cResultsKept = 64;

// A packet starts with its sequence number and the counter value at sending, both
// little-endian; the rest is filler.
const size_t c_cbHeader = 12;

struct TestOptions
{
    bool fVerbose = false;
    bool fRemoteIp = false;
    std::wstring wstrLocalIp;
    DWORD dwLocalPort = 0;
    DWORD dwDelayMs = c_dwDefaultDelayMs;
    DWORD dwCount = c_dwDefaultCount;
    DWORD dwSize = c_dwDefaultSize;
    std::wstring wstrResult;
    std::wstring wstrRelay;
    DWORD dwRelayPort = 0;
};

struct TestResult
{
    DWORD cSent = 0;
    DWORD cReceived = 0;
    DWORD cStray = 0; // datagrams that were no echo of ours
    ULONGLONG ullRttMinUs = 0;
    ULONGLONG ullRttMaxUs = 0;
    ULONGLONG ullRttSumUs = 0;
    FILETIME ftStarted = {};
    FILETIME ftFinished = {};
    std::string strError; // empty when the test ran
};

int Usage(const char *szProblem)
{
    fprintf(stderr,
            "ZoRiVirOruz: %s\n"
            "usage: ZoRiVirOruz.exe [-verbose] [-remoteIP] [-localIP ADDRESS] [-localPort N]\n"
            "                       [-delay MS] [-count N] [-size BYTES] [-result FILE]\n"
            "                       RELAY PORT\n",
            szProblem);
    return c_iExitUsage;
}

bool ParseNumber(const wchar_t *wsz, DWORD dwMax, DWORD *pdw)
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
    if (pwch == wsz || *pwch != L'\0')
    {
        return false;
    }
    *pdw = static_cast<DWORD>(ull);
    return true;
}

const char *ParseOptions(int argc, wchar_t **argv, TestOptions *pOptions)
{
    std::vector<const wchar_t *> rgwszPositional;
    for (int i = 1; i < argc; i++)
    {
        std::wstring arg = argv[i];
        bool fHasValue = i + 1 < argc;
        if (arg == L"-verbose")
        {
            pOptions->fVerbose = true;
        }
        else if (arg == L"-remoteIP")
        {
            pOptions->fRemoteIp = true;
        }
        else if (arg == L"-localIP" && fHasValue)
        {
            pOptions->wstrLocalIp = argv[++i];
        }
        else if (arg == L"-localPort" && fHasValue)
        {
            if (!ParseNumber(argv[++i], 65535, &pOptions->dwLocalPort))
            {
                return "-localPort takes a port number";
            }
        }
        else if (arg == L"-delay" && fHasValue)
        {
            if (!ParseNumber(argv[++i], c_dwMaxDelayMs, &pOptions->dwDelayMs))
            {
                return "-delay takes 0 to 10000 milliseconds";
            }
        }
        else if (arg == L"-count" && fHasValue)
        {
            if (!ParseNumber(argv[++i], c_dwMaxCount, &pOptions->dwCount))
            {
                return "-count takes 0 to 100000 packets";
            }
        }
        else if (arg == L"-size" && fHasValue)
        {
            if (!ParseNumber(argv[++i], c_dwMaxSize, &pOptions->dwSize) ||
                pOptions->dwSize < c_cbHeader)
            {
                return "-size takes 12 to 65507 bytes";
            }
        }
        else if (arg == L"-result" && fHasValue)
        {
            pOptions->wstrResult = argv[++i];
        }
        else if (!arg.empty() && arg[0] == L'-')
        {
            return "unknown option or option without its value";
        }
        else
        {
            rgwszPositional.push_back(argv[i]);
        }
    }
    if (rgwszPositional.size() != 2)
    {
        return "needs RELAY and PORT";
    }
    pOptions->wstrRelay = rgwszPositional[0];
    if (!ParseNumber(rgwszPositional[1], 65535, &pOptions->dwRelayPort) ||
        pOptions->dwRelayPort == 0)
    {
        return "PORT is 1 to 65535";
    }
    return nullptr;
}

std::string Narrow(const std::wstring &wstr)
{
    std::string str;
    for (wchar_t wch : wstr)
    {
        str += wch < 0x80 ? static_cast<char>(wch) : '?';
    }
    return str;
}

void AppendJsonString(std::string &strOut, const std::string &str)
{
    strOut += '"';
    for (char ch : str)
    {
        unsigned char uch = static_cast<unsigned char>(ch);
        if (ch == '"' || ch == '\\')
        {
            strOut += '\\';
            strOut += ch;
        }
        else if (uch < 0x20 || uch >= 0x7F)
        {
            char sz[8];
            sprintf_s(sz, "\\u%04x", uch);
            strOut += sz;
        }
        else
        {
            strOut += ch;
        }
    }
    strOut += '"';
}

ULONGLONG FileTimeValue(const FILETIME &ft)
{
    return (static_cast<ULONGLONG>(ft.dwHighDateTime) << 32) | ft.dwLowDateTime;
}

std::string ResultText(const TestOptions &options, const TestResult &result)
{
    std::string str = "{\"Relay\":";
    AppendJsonString(str, Narrow(options.wstrRelay));
    str += ",\"RelayPort\":" + std::to_string(options.dwRelayPort);
    str += ",\"LocalIP\":";
    AppendJsonString(str, Narrow(options.wstrLocalIp));
    str += ",\"PacketSize\":" + std::to_string(options.dwSize);
    str += ",\"DelayMs\":" + std::to_string(options.dwDelayMs);
    str += ",\"Count\":" + std::to_string(options.dwCount);
    str += ",\"Sent\":" + std::to_string(result.cSent);
    str += ",\"Received\":" + std::to_string(result.cReceived);
    str += ",\"Lost\":" + std::to_string(result.cSent - result.cReceived);
    str += ",\"Stray\":" + std::to_string(result.cStray);
    ULONGLONG ullAvg = result.cReceived != 0 ? result.ullRttSumUs / result.cReceived : 0;
    str += ",\"RttMinUs\":" + std::to_string(result.ullRttMinUs);
    str += ",\"RttAvgUs\":" + std::to_string(ullAvg);
    str += ",\"RttMaxUs\":" + std::to_string(result.ullRttMaxUs);
    str += ",\"Started\":" + std::to_string(FileTimeValue(result.ftStarted));
    str += ",\"Finished\":" + std::to_string(FileTimeValue(result.ftFinished));
    str += ",\"Error\":";
    AppendJsonString(str, result.strError);
    str += "}";
    return str;
}

// The default result file: one per run, named by the start time and the process.
std::wstring DefaultResultPath(const FILETIME &ftStarted)
{
    CreateDirectoryW(c_wszResultFolder, nullptr);
    SYSTEMTIME st;
    FileTimeToSystemTime(&ftStarted, &st);
    wchar_t wszName[MAX_PATH];
    swprintf_s(wszName, L"%s\\result-%04u%02u%02uT%02u%02u%02u.%03uZ-%lu.json", c_wszResultFolder,
               st.wYear, st.wMonth, st.wDay, st.wHour, st.wMinute, st.wSecond, st.wMilliseconds,
               GetCurrentProcessId());
    return wszName;
}

// Deletes the oldest result files beyond c_cResultsKept. Their names start with the UTC
// start time, so name order is age order.
void PruneResults()
{
    std::vector<std::wstring> rgwstrNames;
    WIN32_FIND_DATAW data;
    std::wstring wstrPattern = std::wstring(c_wszResultFolder) + L"\\result-*.json";
    HANDLE hFind = FindFirstFileW(wstrPattern.c_str(), &data);
    if (hFind == INVALID_HANDLE_VALUE)
    {
        return;
    }
    do
    {
        if ((data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY) == 0)
        {
            rgwstrNames.push_back(data.cFileName);
        }
    } while (FindNextFileW(hFind, &data));
    FindClose(hFind);
    if (rgwstrNames.size() <= c_cResultsKept)
    {
        return;
    }
    std::sort(rgwstrNames.begin(), rgwstrNames.end());
    for (size_t i = 0; i < rgwstrNames.size() - c_cResultsKept; i++)
    {
        DeleteFileW((std::wstring(c_wszResultFolder) + L"\\" + rgwstrNames[i]).c_str());
    }
}

bool WriteResult(const std::wstring &wstrPath, const std::string &strText)
{
    HANDLE hFile =
        CreateFileW(wstrPath.c_str(), GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS, 0, nullptr);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return false;
    }
    DWORD cb = 0;
    BOOL fOk = WriteFile(hFile, strText.data(), static_cast<DWORD>(strText.size()), &cb, nullptr);
    fOk = CloseHandle(hFile) && fOk && cb == strText.size();
    return fOk != FALSE;
}

std::string SocketError(const char *szCall)
{
    return std::string(szCall) + " failed with " + std::to_string(WSAGetLastError());
}

// The relay's address: an IP literal with -remoteIP, else whatever the name resolves to.
bool ResolveRelay(const TestOptions &options, sockaddr_storage *pAddr, int *pcbAddr,
                  std::string *pstrError)
{
    ADDRINFOW hints = {};
    hints.ai_family = AF_UNSPEC;
    hints.ai_socktype = SOCK_DGRAM;
    hints.ai_protocol = IPPROTO_UDP;
    hints.ai_flags = options.fRemoteIp ? AI_NUMERICHOST : 0;
    ADDRINFOW *pInfo = nullptr;
    std::wstring wstrPort = std::to_wstring(options.dwRelayPort);
    int iErr = GetAddrInfoW(options.wstrRelay.c_str(), wstrPort.c_str(), &hints, &pInfo);
    if (iErr != 0 || pInfo == nullptr)
    {
        *pstrError = "cannot resolve the relay: " + std::to_string(iErr);
        return false;
    }
    memcpy(pAddr, pInfo->ai_addr, pInfo->ai_addrlen);
    *pcbAddr = static_cast<int>(pInfo->ai_addrlen);
    FreeAddrInfoW(pInfo);
    return true;
}

// Binds to the adapter's address (and port) when given, so the test measures that adapter.
bool BindLocal(SOCKET s, int iFamily, const TestOptions &options, std::string *pstrError)
{
    if (options.wstrLocalIp.empty() && options.dwLocalPort == 0)
    {
        return true;
    }
    sockaddr_storage addr = {};
    int cbAddr = iFamily == AF_INET6 ? sizeof(sockaddr_in6) : sizeof(sockaddr_in);
    addr.ss_family = static_cast<ADDRESS_FAMILY>(iFamily);
    if (!options.wstrLocalIp.empty())
    {
        void *pvAddr =
            iFamily == AF_INET6
                ? static_cast<void *>(&reinterpret_cast<sockaddr_in6 *>(&addr)->sin6_addr)
                : static_cast<void *>(&reinterpret_cast<sockaddr_in *>(&addr)->sin_addr);
        if (InetPtonW(iFamily, options.wstrLocalIp.c_str(), pvAddr) != 1)
        {
            *pstrError = "the local address is no address of the relay's family";
            return false;
        }
    }
    USHORT usPort = htons(static_cast<USHORT>(options.dwLocalPort));
    if (iFamily == AF_INET6)
    {
        reinterpret_cast<sockaddr_in6 *>(&addr)->sin6_port = usPort;
    }
    else
    {
        reinterpret_cast<sockaddr_in *>(&addr)->sin_port = usPort;
    }
    if (bind(s, reinterpret_cast<sockaddr *>(&addr), cbAddr) != 0)
    {
        *pstrError = SocketError("bind");
        return false;
    }
    return true;
}

class CEchoTest
{
public:
    CEchoTest(const TestOptions &options, TestResult *pResult)
        : m_options(options)
        , m_pResult(pResult)
        , m_rgllSentAt(options.dwCount, 0)
        , m_rgfEchoed(options.dwCount, false)
        , m_vbPacket(options.dwSize, 0x5A)
    {
        QueryPerformanceFrequency(&m_liFrequency);
    }

    ~CEchoTest()
    {
        if (m_s != INVALID_SOCKET)
        {
            closesocket(m_s);
        }
    }

    bool Run()
    {
        sockaddr_storage addrRelay = {};
        int cbRelay = 0;
        if (!ResolveRelay(m_options, &addrRelay, &cbRelay, &m_pResult->strError))
        {
            return false;
        }
        m_s = socket(addrRelay.ss_family, SOCK_DGRAM, IPPROTO_UDP);
        if (m_s == INVALID_SOCKET)
        {
            m_pResult->strError = SocketError("socket");
            return false;
        }
        if (!BindLocal(m_s, addrRelay.ss_family, m_options, &m_pResult->strError))
        {
            return false;
        }
        // Connected, the socket receives only what the relay sends.
        if (connect(m_s, reinterpret_cast<sockaddr *>(&addrRelay), cbRelay) != 0)
        {
            m_pResult->strError = SocketError("connect");
            return false;
        }
        ULONGLONG ullStart = GetTickCount64();
        for (DWORD i = 0; i < m_options.dwCount; i++)
        {
            if (GetTickCount64() - ullStart > c_ullMaxRunMs)
            {
                break;
            }
            if (!Send(i))
            {
                return false;
            }
            ULONGLONG ullNext = GetTickCount64() + m_options.dwDelayMs;
            if (!ReceiveUntil(ullNext))
            {
                return false;
            }
        }
        return ReceiveUntil(GetTickCount64() + c_dwDrainMs);
    }

private:
    bool Send(DWORD dwSequence)
    {
        LARGE_INTEGER liNow;
        QueryPerformanceCounter(&liNow);
        m_rgllSentAt[dwSequence] = liNow.QuadPart;
        memcpy(m_vbPacket.data(), &dwSequence, sizeof(dwSequence));
        memcpy(m_vbPacket.data() + sizeof(dwSequence), &liNow.QuadPart, sizeof(liNow.QuadPart));
        int cb = send(m_s, reinterpret_cast<const char *>(m_vbPacket.data()),
                      static_cast<int>(m_vbPacket.size()), 0);
        if (cb == SOCKET_ERROR)
        {
            int iErr = WSAGetLastError();
            if (iErr == WSAECONNRESET || iErr == WSAENETUNREACH || iErr == WSAEHOSTUNREACH)
            {
                m_pResult->cSent++; // the network lost it: sent, and never echoed
                return true;
            }
            m_pResult->strError = SocketError("send");
            return false;
        }
        m_pResult->cSent++;
        return true;
    }

    // Takes echoes until the deadline, or until every packet sent so far has come back
    // when all have been sent.
    bool ReceiveUntil(ULONGLONG ullDeadline)
    {
        std::vector<char> vbBuffer(m_options.dwSize + 1);
        for (;;)
        {
            ULONGLONG ullNow = GetTickCount64();
            if (ullNow >= ullDeadline ||
                (m_pResult->cSent == m_options.dwCount && m_pResult->cReceived == m_pResult->cSent))
            {
                return true;
            }
            fd_set readable;
            FD_ZERO(&readable);
            FD_SET(m_s, &readable);
            ULONGLONG ullWaitMs = ullDeadline - ullNow;
            timeval tv = {static_cast<long>(ullWaitMs / 1000),
                          static_cast<long>((ullWaitMs % 1000) * 1000)};
            int iReady = select(0, &readable, nullptr, nullptr, &tv);
            if (iReady == SOCKET_ERROR)
            {
                m_pResult->strError = SocketError("select");
                return false;
            }
            if (iReady == 0)
            {
                continue;
            }
            int cb = recv(m_s, vbBuffer.data(), static_cast<int>(vbBuffer.size()), 0);
            if (cb == SOCKET_ERROR)
            {
                int iErr = WSAGetLastError();
                if (iErr == WSAECONNRESET || iErr == WSAEMSGSIZE)
                {
                    continue; // nobody listens at the relay yet, or a datagram not ours
                }
                m_pResult->strError = SocketError("recv");
                return false;
            }
            Echo(vbBuffer.data(), static_cast<size_t>(cb));
        }
    }

    void Echo(const char *pb, size_t cb)
    {
        LARGE_INTEGER liNow;
        QueryPerformanceCounter(&liNow);
        DWORD dwSequence = 0;
        LONGLONG llSentAt = 0;
        if (cb == m_options.dwSize)
        {
            memcpy(&dwSequence, pb, sizeof(dwSequence));
            memcpy(&llSentAt, pb + sizeof(dwSequence), sizeof(llSentAt));
        }
        if (cb != m_options.dwSize || dwSequence >= m_options.dwCount || m_rgfEchoed[dwSequence] ||
            m_rgllSentAt[dwSequence] != llSentAt || llSentAt == 0)
        {
            m_pResult->cStray++;
            return;
        }
        m_rgfEchoed[dwSequence] = true;
        ULONGLONG ullUs = static_cast<ULONGLONG>(liNow.QuadPart - llSentAt) * 1000000ull /
                          static_cast<ULONGLONG>(m_liFrequency.QuadPart);
        if (m_pResult->cReceived == 0 || ullUs < m_pResult->ullRttMinUs)
        {
            m_pResult->ullRttMinUs = ullUs;
        }
        if (ullUs > m_pResult->ullRttMaxUs)
        {
            m_pResult->ullRttMaxUs = ullUs;
        }
        m_pResult->ullRttSumUs += ullUs;
        m_pResult->cReceived++;
        if (m_options.fVerbose)
        {
            printf("echo %lu: %llu us\n", static_cast<unsigned long>(dwSequence), ullUs);
        }
    }

    const TestOptions &m_options;
    TestResult *m_pResult;
    SOCKET m_s = INVALID_SOCKET;
    LARGE_INTEGER m_liFrequency = {};
    std::vector<LONGLONG> m_rgllSentAt;
    std::vector<bool> m_rgfEchoed;
    std::vector<BYTE> m_vbPacket;
};
} // namespace

int wmain(int argc, wchar_t **argv)
{
    TestOptions options;
    const char *szProblem = ParseOptions(argc, argv, &options);
    if (szProblem != nullptr)
    {
        return Usage(szProblem);
    }
    TestResult result;
    GetSystemTimeAsFileTime(&result.ftStarted);
    bool fRan = false;
    WSADATA wsa;
    int iErr = WSAStartup(MAKEWORD(2, 2), &wsa);
    if (iErr != 0)
    {
        result.strError = "WSAStartup failed with " + std::to_string(iErr);
    }
    else
    {
        CEchoTest test(options, &result);
        fRan = test.Run();
    }
    GetSystemTimeAsFileTime(&result.ftFinished);
    if (iErr == 0)
    {
        WSACleanup();
    }

    std::wstring wstrPath =
        options.wstrResult.empty() ? DefaultResultPath(result.ftStarted) : options.wstrResult;
    std::string strText = ResultText(options, result);
    bool fWritten = WriteResult(wstrPath, strText);
    if (options.wstrResult.empty())
    {
        PruneResults();
    }
    printf("%s\n", strText.c_str());
    if (!fWritten)
    {
        fprintf(stderr, "ZoRiVirOruz: cannot write the result file %ls\n", wstrPath.c_str());
        return c_iExitFailed;
    }
    if (options.fVerbose)
    {
        printf("result written to %ls\n", wstrPath.c_str());
    }
    return fRan ? c_iExitOk : c_iExitFailed;
}
