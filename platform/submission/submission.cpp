#include "platform/submission/submission.h"
#include "platform/submission/submissionspool.h"

#include <rpc.h>

#include <cstring>
#include <cwchar>
#include <string>

namespace
{
// Written by the default constructor into the library's bytes; a profile without it was
// not prepared by this library.
const BYTE c_rgbProfileSignature[8] = {'C', 'S', 'P', 'R', 'O', 'F', 1, 0};

std::string Code(DWORD dw)
{
    char sz[16];
    snprintf(sz, sizeof(sz), "0x%lx", static_cast<unsigned long>(dw));
    return sz;
}

std::string Narrow(const wchar_t *wsz)
{
    if (wsz == nullptr)
    {
        return "null";
    }
    std::string str;
    for (; *wsz != L'\0'; wsz++)
    {
        str += (*wsz > L' ' && *wsz < 0x7F) ? static_cast<char>(*wsz) : '?';
    }
    return str;
}

std::string GuidText(const GUID *pGuid)
{
    if (pGuid == nullptr)
    {
        return "null";
    }
    RPC_CSTR sz = nullptr;
    if (UuidToStringA(const_cast<GUID *>(pGuid), &sz) != RPC_S_OK)
    {
        return "?";
    }
    std::string str(reinterpret_cast<const char *>(sz));
    RpcStringFreeA(&sz);
    return str;
}

// Writes the file under a temporary name and renames it, so the spool folder only ever
// shows complete submissions.
DWORD SpoolSubmission(const std::string &strHeader, const BYTE *pbData, DWORD cbData,
                      ULONGLONG ullSubmitted)
{
    static volatile LONG s_lSequence = 0;
    if (!SubmissionCreateSpoolDirectory())
    {
        return GetLastError();
    }
    wchar_t wszName[80];
    swprintf(wszName, 80, L"\\%020llu-%08lx-%08lx", static_cast<unsigned long long>(ullSubmitted),
             static_cast<unsigned long>(GetCurrentProcessId()),
             static_cast<unsigned long>(InterlockedIncrement(&s_lSequence)));
    std::wstring wstrFinal = SubmissionSpoolDirectory() + wszName + c_wszSubmissionSuffix;
    std::wstring wstrTemporary = SubmissionSpoolDirectory() + wszName + L".tmp";
    HANDLE hFile = CreateFileW(wstrTemporary.c_str(), GENERIC_WRITE, 0, nullptr, CREATE_NEW,
                               FILE_ATTRIBUTE_NORMAL, nullptr);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return GetLastError();
    }
    DWORD dwError = ERROR_SUCCESS;
    const BYTE *rgpb[2] = {reinterpret_cast<const BYTE *>(strHeader.data()), pbData};
    DWORD rgcb[2] = {static_cast<DWORD>(strHeader.size()), cbData};
    for (int i = 0; i < 2 && dwError == ERROR_SUCCESS; i++)
    {
        DWORD cbDone = 0;
        while (cbDone < rgcb[i])
        {
            DWORD cbWritten = 0;
            if (!WriteFile(hFile, rgpb[i] + cbDone, rgcb[i] - cbDone, &cbWritten, nullptr))
            {
                dwError = GetLastError();
                break;
            }
            cbDone += cbWritten;
        }
    }
    if (!CloseHandle(hFile) && dwError == ERROR_SUCCESS)
    {
        dwError = GetLastError();
    }
    if (dwError == ERROR_SUCCESS &&
        !MoveFileExW(wstrTemporary.c_str(), wstrFinal.c_str(), MOVEFILE_WRITE_THROUGH))
    {
        dwError = GetLastError();
    }
    if (dwError != ERROR_SUCCESS)
    {
        DeleteFileW(wstrTemporary.c_str());
    }
    return dwError;
}
} // namespace

CrowdsourcingProfile_t::CrowdsourcingProfile_t()
{
    memset(wszProfileName, 0, sizeof(wszProfileName));
    memset(rgdwSettings, 0, sizeof(rgdwSettings));
    memset(rgbLibraryState, 0, sizeof(rgbLibraryState));
    memcpy(rgbLibraryState, c_rgbProfileSignature, sizeof(c_rgbProfileSignature));
    SubmissionAppendJournal("CrowdsourcingProfile_t()");
}

CrowdsourcingProfile_t::~CrowdsourcingProfile_t()
{
    SubmissionAppendJournal("~CrowdsourcingProfile_t()");
}

CrowdsourcingDataSubmitter_t::CrowdsourcingDataSubmitter_t(const CrowdsourcingProfile_t &profile,
                                                           const wchar_t *wszTarget,
                                                           int iTargetFlags,
                                                           const wchar_t *wszTargetParameters)
    : m_strTarget(Narrow(wszTarget) + " " + std::to_string(iTargetFlags) + " " +
                  Narrow(wszTargetParameters))
    , m_fInitialized(false)
{
    memcpy(m_rgbProfile, &profile, sizeof(m_rgbProfile));
    SubmissionAppendJournal("CrowdsourcingDataSubmitter_t(profile, " + m_strTarget + ")");
}

CrowdsourcingDataSubmitter_t::~CrowdsourcingDataSubmitter_t()
{
    SubmissionAppendJournal("~CrowdsourcingDataSubmitter_t()");
}

DWORD CrowdsourcingDataSubmitter_t::Init()
{
    DWORD dwResult = SubmissionGetResult(L"InitResult");
    const CrowdsourcingProfile_t *pProfile =
        reinterpret_cast<const CrowdsourcingProfile_t *>(m_rgbProfile);
    if (dwResult == 0 && (memcmp(pProfile->rgbLibraryState, c_rgbProfileSignature,
                                 sizeof(c_rgbProfileSignature)) != 0 ||
                          wmemchr(pProfile->wszProfileName, L'\0', 32) == nullptr ||
                          pProfile->wszProfileName[0] == L'\0'))
    {
        dwResult = ERROR_INVALID_PARAMETER;
    }
    m_fInitialized = dwResult == 0;
    SubmissionAppendJournal("Init() = " + Code(dwResult));
    return dwResult;
}

DWORD CrowdsourcingDataSubmitter_t::SubmitData(const BYTE *pbData, DWORD cbData, const GUID *pGuid)
{
    DWORD dwResult = SubmissionGetResult(L"SubmitResult");
    if (dwResult == 0 && !m_fInitialized)
    {
        dwResult = ERROR_INVALID_STATE;
    }
    if (dwResult == 0 && pbData == nullptr && cbData != 0)
    {
        dwResult = ERROR_INVALID_PARAMETER;
    }
    if (dwResult == 0)
    {
        FILETIME ft;
        GetSystemTimeAsFileTime(&ft);
        ULONGLONG ullNow = (static_cast<ULONGLONG>(ft.dwHighDateTime) << 32) | ft.dwLowDateTime;
        dwResult = SpoolSubmission(
            SubmissionFormatHeader(m_rgbProfile, m_strTarget, GuidText(pGuid), ullNow, cbData),
            pbData, cbData, ullNow);
    }
    SubmissionAppendJournal("SubmitData(" + std::to_string(cbData) + " bytes, " + GuidText(pGuid) +
                            ") = " + Code(dwResult));
    return dwResult;
}
