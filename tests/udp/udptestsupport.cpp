#include "tests/udp/udptestsupport.h"

#include "service/udptestpolicy.h"
#include "servicelib/eventtrace.h"

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

} // namespace udptest
