#include "service/tracesinks.h"

#include "inc/handleholder.h"
#include "platform/submission/submission.h"
#include "servicelib/eventtrace.h"

#include <rpc.h>

#include <cwchar>

namespace TraceSinks
{
const wchar_t c_wszTraceDirectory[] = L"C:\\Data\\Test\\WiFiLog";
const wchar_t c_wszTemporarySuffix[] = L".tmp";

namespace
{
const wchar_t c_wszPreferenceKey[] =
    L"System\\CurrentControlSet\\Services\\Ambrel\\Parameters\\CrowdsrcPlugin";
const wchar_t c_wszPreferenceValue[] = L"EnableWifiCrowdsourcing";
const wchar_t c_wszTestKey[] = L"System\\CurrentControlSet\\Services\\Telvane\\Parameters";
const wchar_t c_wszTestValue[] = L"EnableTestLogging";

const wchar_t c_wszProfileName[] = L"ZARI_DavoDuvuri_Z1";
const DWORD c_rgdwProfileSettings[8] = {0xFFFFFFFF, 1, 1, 0, 1, 1, 4096, 500};

PFN_TRACE_WRITE_FILE s_pfnWriteFile = nullptr;

// Writes every byte, going on after short writes; false at the first failure.
bool WriteAll(HANDLE hFile, const char *pchText, size_t cchText)
{
    PFN_TRACE_WRITE_FILE pfnWriteFile = s_pfnWriteFile != nullptr ? s_pfnWriteFile : WriteFile;
    while (cchText > 0)
    {
        DWORD cbChunk = cchText > 0x40000000 ? 0x40000000 : static_cast<DWORD>(cchText);
        DWORD cbWritten = 0;
        if (!pfnWriteFile(hFile, pchText, cbChunk, &cbWritten, nullptr))
        {
            return false;
        }
        // A write that reports success without progress would loop for ever.
        if (cbWritten == 0)
        {
            SetLastError(ERROR_WRITE_FAULT);
            return false;
        }
        pchText += cbWritten;
        cchText -= cbWritten;
    }
    return true;
}
} // namespace

bool IsCrowdsourcingEnabled()
{
    DWORD dwValue = 0;
    DWORD cbValue = sizeof(dwValue);
    CRegKeyHandle key;
    if (RegOpenKeyExW(HKEY_LOCAL_MACHINE, c_wszPreferenceKey, 0, KEY_READ, key.Receive()) !=
        ERROR_SUCCESS)
    {
        key.Detach(); // nothing was opened
        return false;
    }
    // The type is not checked: whatever the value holds is read as a number.
    LONG lStatus = RegQueryValueExW(key.Get(), c_wszPreferenceValue, nullptr, nullptr,
                                    reinterpret_cast<BYTE *>(&dwValue), &cbValue);
    return lStatus == ERROR_SUCCESS && (dwValue & 3) == 3;
}

void DeliverTrace(const char *pchText, size_t cchText)
{
    TelvaneTrace("CServiceOperation::Reading Test Registry key");
    DWORD dwValue = 0;
    DWORD cbValue = sizeof(dwValue);
    if (RegGetValueW(HKEY_LOCAL_MACHINE, c_wszTestKey, c_wszTestValue, RRF_RT_REG_DWORD, nullptr,
                     &dwValue, &cbValue) != ERROR_SUCCESS)
    {
        WriteTraceToVantor(pchText, cchText);
        return;
    }
    if (dwValue == 1)
    {
        TelvaneTrace("CServiceOperation::Test Registry key value set, sending to just file");
        WriteTraceToFile(pchText, cchText);
    }
    else if (dwValue == 2)
    {
        TelvaneTrace("CServiceOperation::Test Registry key value set, sending to both file and "
                     "Vantor");
        WriteTraceToFile(pchText, cchText);
        WriteTraceToVantor(pchText, cchText);
    }
}

HRESULT WriteTraceToFile(const char *pchText, size_t cchText)
{
    TelvaneTrace("CServiceOperation::Writing trace to filesystem");
    std::wstring wstrPath;
    if (MakeTraceFileName(wstrPath) != S_OK)
    {
        return E_FAIL;
    }
    std::wstring wstrTemporary = wstrPath + c_wszTemporarySuffix;
    CFileHandle file(CreateFileW(wstrTemporary.c_str(), GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS,
                                 FILE_ATTRIBUTE_NORMAL, nullptr));
    if (!file.IsValid())
    {
        return HRESULT_FROM_WIN32(GetLastError());
    }
    DWORD dwError = ERROR_SUCCESS;
    if (!WriteAll(file.Get(), pchText, cchText))
    {
        dwError = GetLastError();
    }
    if (!file.Close() && dwError == ERROR_SUCCESS)
    {
        dwError = GetLastError();
    }
    // The final name is new (a fresh GUID), so nothing is replaced.
    if (dwError == ERROR_SUCCESS &&
        !MoveFileExW(wstrTemporary.c_str(), wstrPath.c_str(), MOVEFILE_WRITE_THROUGH))
    {
        dwError = GetLastError();
    }
    if (dwError != ERROR_SUCCESS)
    {
        DeleteFileW(wstrTemporary.c_str());
        return HRESULT_FROM_WIN32(dwError);
    }
    return S_OK;
}

HRESULT MakeTraceFileName(std::wstring &wstrPath)
{
    wstrPath = c_wszTraceDirectory;
    // Only the last folder is made: a device without C:\Data\Test is not a test device.
    if (GetFileAttributesW(wstrPath.c_str()) == INVALID_FILE_ATTRIBUTES &&
        !CreateDirectoryW(wstrPath.c_str(), nullptr))
    {
        return E_FAIL;
    }
    UUID uuid;
    RPC_WSTR wszUuid = nullptr;
    if (UuidCreate(&uuid) != RPC_S_OK || UuidToStringW(&uuid, &wszUuid) != RPC_S_OK)
    {
        return E_FAIL;
    }
    wstrPath += L'\\';
    wstrPath += reinterpret_cast<const wchar_t *>(wszUuid);
    RpcStringFreeW(&wszUuid);
    return S_OK;
}

void SetWriteFileForTest(PFN_TRACE_WRITE_FILE pfnWriteFile)
{
    s_pfnWriteFile = pfnWriteFile;
}

void WriteTraceToVantor(const char *pchText, size_t cchText)
{
    TelvaneTrace("CServiceOperation::Writing trace to Vantor");
    CrowdsourcingProfile_t profile;
    // Bounded copy: the name must fit its 32 characters with the terminator.
    size_t cchName = wcslen(c_wszProfileName);
    if (cchName >= sizeof(profile.wszProfileName) / sizeof(profile.wszProfileName[0]))
    {
        return;
    }
    wmemcpy(profile.wszProfileName, c_wszProfileName, cchName + 1);
    for (size_t i = 0; i < 8; i++)
    {
        profile.rgdwSettings[i] = c_rgdwProfileSettings[i];
    }
    CrowdsourcingDataSubmitter_t submitter(profile, nullptr, 0, nullptr);
    DWORD dwCode = submitter.Init();
    if (dwCode != 0)
    {
        TelvaneTraceFailure("Vantor Init()", dwCode);
        return;
    }
    // The library takes a 32-bit length; a longer text cannot be submitted whole.
    if (cchText > 0xFFFFFFFFull)
    {
        TelvaneTraceFailure("Vantor SubmitData()", static_cast<ULONG>(E_INVALIDARG));
        return;
    }
    dwCode = submitter.SubmitData(reinterpret_cast<const BYTE *>(pchText),
                                  static_cast<DWORD>(cchText), nullptr);
    if (dwCode != 0)
    {
        TelvaneTraceFailure("Vantor SubmitData()", dwCode);
    }
}
} // namespace TraceSinks
