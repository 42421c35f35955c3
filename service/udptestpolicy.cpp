#include "service/udptestpolicy.h"
#include "inc/lasterror.h"

#include "inc/handleholder.h"
#include "lib/jsonreader.h"
#include "service/isoduration.h"
#include "servicelib/eventtrace.h"

#include <locale>
#include <memory>
#include <sstream>

namespace
{
const DWORD c_cbReadBlock = 512;

bool UdpPolicyIsWhiteSpace(char ch)
{
    return ch == ' ' || ch == '\t' || ch == '\n' || ch == '\r';
}

bool UdpPolicyEqualsIgnoringCase(const std::string &strText, const char *szWord)
{
    size_t i = 0;
    for (; szWord[i] != '\0'; i++)
    {
        if (i >= strText.size())
        {
            return false;
        }
        char ch = strText[i];
        if (ch >= 'A' && ch <= 'Z')
        {
            ch = static_cast<char>(ch - 'A' + 'a');
        }
        if (ch != szWord[i])
        {
            return false;
        }
    }
    return i == strText.size();
}

// Numbers are read like a text-stream extraction in the classic locale: white space, an
// optional sign, then the number up to the first byte that does not belong to it. A text
// with no number, or one out of range, reads as nothing at all.
template <class T>
bool UdpPolicyReadNumber(const std::string &strText, T *pValue)
{
    std::istringstream stream(strText);
    stream.imbue(std::locale::classic());
    T value{};
    stream >> value;
    if (stream.fail())
    {
        return false;
    }
    *pValue = value;
    return true;
}

// A member whose text is not a number counts as absent: its field keeps its value.
void UdpPolicyApplyDword(const JsonObjectNode *pRoot, const char *szName, uint32_t *pulField)
{
    uint32_t ul = 0;
    if (pRoot->GetMemberNumber(szName, ul))
    {
        *pulField = ul;
    }
}

// "Expiration" or "LastTest": absent or not a number gives false.
bool UdpPolicyReadTime(const JsonObjectNode *pRoot, const char *szName, uint64_t *pullTime)
{
    std::string strText;
    int64_t llTime = 0;
    if (!pRoot->GetMemberText(szName, strText) || strText.empty() ||
        !UdpPolicyReadNumber(strText, &llTime))
    {
        return false;
    }
    *pullTime = static_cast<uint64_t>(llTime);
    return true;
}

HRESULT UdpPolicyReadFile(std::string *pstrText)
{
    CFileHandle hFile(CreateFileW(c_wszUdpConfigFile, GENERIC_READ, 0, nullptr, OPEN_EXISTING,
                                  FILE_ATTRIBUTE_NORMAL, nullptr));
    if (!hFile)
    {
        HRESULT hr = HResultFromLastError();
        TelvaneTraceUdpFailure("CreateFile (read)", static_cast<ULONG>(hr));
        return hr;
    }
    char rgchBlock[c_cbReadBlock];
    DWORD cbRead = 0;
    while (ReadFile(hFile.Get(), rgchBlock, sizeof(rgchBlock), &cbRead, nullptr) && cbRead != 0)
    {
        pstrText->append(rgchBlock, cbRead);
    }
    return S_OK;
}

// Writes the whole text under the temporary name, flushed, then renames it over the policy.
HRESULT UdpPolicyWriteFile(const std::string &strText)
{
    CFileHandle hFile(CreateFileW(c_wszUdpConfigTempFile, GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS,
                                  FILE_ATTRIBUTE_NORMAL, nullptr));
    if (!hFile)
    {
        HRESULT hr = HResultFromLastError();
        TelvaneTraceUdpFailure("CreateFile (write)", static_cast<ULONG>(hr));
        return hr;
    }
    const char *szStep = nullptr;
    HRESULT hr = S_OK;
    DWORD cbWritten = 0;
    if (!WriteFile(hFile.Get(), strText.data(), static_cast<DWORD>(strText.size()), &cbWritten,
                   nullptr))
    {
        szStep = "WriteFile";
        hr = HResultFromLastError();
    }
    else if (cbWritten != strText.size())
    {
        szStep = "WriteFile";
        hr = HRESULT_FROM_WIN32(ERROR_HANDLE_DISK_FULL);
    }
    else if (!FlushFileBuffers(hFile.Get()))
    {
        szStep = "FlushFileBuffers";
        hr = HResultFromLastError();
    }
    else if (!hFile.Close())
    {
        szStep = "CloseHandle";
        hr = HResultFromLastError();
    }
    else if (!MoveFileExW(c_wszUdpConfigTempFile, c_wszUdpConfigFile,
                          MOVEFILE_REPLACE_EXISTING | MOVEFILE_WRITE_THROUGH))
    {
        szStep = "MoveFileEx";
        hr = HResultFromLastError();
    }
    if (FAILED(hr))
    {
        TelvaneTraceUdpFailure(szStep, static_cast<ULONG>(hr));
        hFile.Close();
        DeleteFileW(c_wszUdpConfigTempFile);
    }
    return hr;
}
} // namespace

uint64_t UdpConfigNow()
{
    SYSTEMTIME st;
    FILETIME ft = {};
    GetSystemTime(&st);
    SystemTimeToFileTime(&st, &ft);
    return (static_cast<uint64_t>(ft.dwHighDateTime) << 32) | ft.dwLowDateTime;
}

bool IsConfigExpired(const UdpTestConfig *pConfig)
{
    // FILETIMEs compare as unsigned 64-bit counts, as CompareFileTime does.
    return pConfig->expiration < UdpConfigNow();
}

HRESULT ApplyUdpConfig(UdpTestConfig *pConfig, const JsonObjectNode *pRoot)
{
    if (pConfig == nullptr || pRoot == nullptr)
    {
        return E_POINTER;
    }
    std::string strText;
    if (pRoot->GetMemberText("Enabled", strText))
    {
        pConfig->enabled = UdpPolicyEqualsIgnoringCase(strText, "true");
    }
    if (pRoot->GetMemberText("RelayFQDN", strText))
    {
        // The name goes unquoted onto a command line. A name that is neither a host name
        // nor an IP literal fails the answer like a missing expiration does: what came
        // before it stays applied, nothing after it is.
        if (!UdpRelayNameIsValid(strText))
        {
            TelvaneTraceUdpFailure("RelayFQDN", static_cast<ULONG>(E_INVALIDARG));
            return E_INVALIDARG;
        }
        pConfig->relayFqdn = strText;
    }
    UdpPolicyApplyDword(pRoot, "RelayPort", &pConfig->relayPort);
    UdpPolicyApplyDword(pRoot, "NumPackets", &pConfig->numPackets);
    if (pRoot->GetMemberText("MaxTestDay", strText))
    {
        UdpPolicyReadNumber(strText, &pConfig->maxTestDay);
    }

    std::string strDuration;
    std::string strPolicy;
    pRoot->GetMemberText("DurationValid", strDuration);
    pRoot->GetMemberText("Policy", strPolicy);

    // A lifetime relative to now wins over an absolute time; the file keeps the absolute one.
    if (!strDuration.empty())
    {
        DurationParts parts;
        HRESULT hr = ParseIsoDuration(strDuration.c_str(), &parts);
        if (FAILED(hr))
        {
            return hr;
        }
        pConfig->expiration = UdpConfigNow() + IsoDurationTicks(parts);
    }
    else if (!UdpPolicyReadTime(pRoot, "Expiration", &pConfig->expiration))
    {
        // Without a usable expiration the policy would be fetched again at every trigger.
        return E_INVALIDARG;
    }
    UdpPolicyReadTime(pRoot, "LastTest", &pConfig->lastTest);
    pConfig->acOnly = strPolicy != "BattAC";
    return S_OK;
}

HRESULT LoadUdpConfig(UdpTestConfig *pConfig)
{
    TelvaneTraceMark(TelvaneEvent_UdpConfigRead);
    std::string strText;
    HRESULT hr = UdpPolicyReadFile(&strText);
    if (FAILED(hr))
    {
        return hr;
    }
    const char *szText = strText.c_str();
    while (UdpPolicyIsWhiteSpace(*szText))
    {
        szText++;
    }
    std::unique_ptr<JsonValue> pRoot(JsonReader::FromJsonString(szText));
    if (pRoot == nullptr || pRoot->Type() != JsonNodeType::Object)
    {
        TelvaneTraceUdpFailure("JsonReader::FromJsonString", ERROR_BAD_FORMAT);
        return HRESULT_FROM_WIN32(ERROR_BAD_FORMAT);
    }
    return ApplyUdpConfig(pConfig, static_cast<const JsonObjectNode *>(pRoot.get()));
}

HRESULT SaveUdpConfig(const UdpTestConfig *pConfig)
{
    std::string strText;
    {
        JsonObjectNode root;
        root.Reserve(8);
        root.AddBool("Enabled", pConfig->enabled);
        root.AddString("RelayFQDN", pConfig->relayFqdn);
        root.AddDword("RelayPort", pConfig->relayPort);
        root.AddInt64("Expiration", static_cast<int64_t>(pConfig->expiration));
        root.AddInt64("LastTest", static_cast<int64_t>(pConfig->lastTest));
        root.AddDword("NumPackets", pConfig->numPackets);
        root.AddFloat("MaxTestDay", pConfig->maxTestDay);
        root.AddStringOrNull("Policy", pConfig->acOnly ? "ACOnly" : "BattAC");
        root.ToString(strText);
    }
    TelvaneTraceMark(TelvaneEvent_UdpConfigWritten);
    return UdpPolicyWriteFile(strText);
}
