#include "lib/cjsonobject.h"

#include "servicelib/diagnostics.h"
#include "servicelib/eventtrace.h"

#include <objbase.h>
#include <rpc.h>

#include <cstring>
#include <memory>

// {35365921-6920-4683-984A-AC3796296818}
EXTERN_C const IID IID_IJsonObject = {
    0x35365921, 0x6920, 0x4683, {0x98, 0x4A, 0xAC, 0x37, 0x96, 0x29, 0x68, 0x18}};

namespace
{
// The counting both holders share. A tag past the six would write outside the counts:
// it is reported like a release under an empty tag, and no count changes.
ULONG JsonHolderAddRef(TaggedRefCount<c_cJsonTags> &refs, ULONG ulTag, const wchar_t *wszAddRef)
{
    if (ulTag >= c_cJsonTags)
    {
        TaggedRefFailure(wszAddRef, TELVANE_WFILE, __LINE__, L"AddRef");
        return static_cast<ULONG>(refs.Total());
    }
    return refs.AddRef(ulTag);
}

// Returns the new total; the holder deletes itself at 0.
ULONG JsonHolderRelease(TaggedRefCount<c_cJsonTags> &refs, ULONG ulTag, const wchar_t *wszRelease)
{
    if (ulTag >= c_cJsonTags)
    {
        TaggedRefFailure(wszRelease, TELVANE_WFILE, __LINE__, L"Release");
        return static_cast<ULONG>(refs.Total());
    }
    return refs.Release(ulTag, wszRelease, TELVANE_WFILE, __LINE__);
}
} // namespace

std::string WideToNarrow(LPCWSTR wszText)
{
    char szBuffer[256];
    if (wszText == nullptr || WideCharToMultiByte(CP_ACP, 0, wszText, -1, szBuffer,
                                                  sizeof(szBuffer), nullptr, nullptr) == 0)
    {
        return "error";
    }
    return szBuffer;
}

std::string GuidToString(const GUID &guid)
{
    RPC_CSTR szGuid = nullptr;
    if (UuidToStringA(const_cast<GUID *>(&guid), &szGuid) != RPC_S_OK || szGuid == nullptr)
    {
        return std::string();
    }
    std::string str(reinterpret_cast<const char *>(szGuid));
    RpcStringFreeA(&szGuid);
    return str;
}

CJsonObject::CJsonObject()
    : m_pNode(new JsonObjectNode())
{
}

CJsonObject::~CJsonObject()
{
    delete m_pNode;
}

HRESULT STDMETHODCALLTYPE CJsonObject::QueryInterface(REFIID riid, void **ppvObject)
{
    if (ppvObject == nullptr)
    {
        ASSERT_CHECK(L"CJsonObject::QueryInterface", FALSE);
        return E_POINTER;
    }
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IJsonObject))
    {
        *ppvObject = static_cast<IJsonObject *>(this);
        AddRef(0);
        return S_OK;
    }
    *ppvObject = nullptr;
    return E_NOINTERFACE;
}

ULONG STDMETHODCALLTYPE CJsonObject::AddRef()
{
    return AddRef(0);
}

ULONG STDMETHODCALLTYPE CJsonObject::Release()
{
    return Release(0);
}

ULONG CJsonObject::AddRef(ULONG ulTag)
{
    return JsonHolderAddRef(m_refs, ulTag, L"CJsonObject::AddRef");
}

ULONG CJsonObject::Release(ULONG ulTag)
{
    ULONG cRef = JsonHolderRelease(m_refs, ulTag, L"CJsonObject::Release");
    if (cRef == 0)
    {
        delete this;
    }
    return cRef;
}

HRESULT CJsonObject::AppendValue(std::string strName, JsonValue *pValue)
{
    std::unique_ptr<JsonValue> value(pValue);
    if (m_pNode == nullptr)
    {
        return E_UNEXPECTED;
    }
    m_pNode->Append(std::move(strName), value.release());
    return S_OK;
}

HRESULT STDMETHODCALLTYPE CJsonObject::AddDword(LPCWSTR wszName, DWORD dwValue)
{
    return AddDword(WideToNarrow(wszName), dwValue);
}

HRESULT STDMETHODCALLTYPE CJsonObject::AddUlong(LPCWSTR wszName, ULONG ulValue)
{
    return AddDword(WideToNarrow(wszName), ulValue);
}

HRESULT STDMETHODCALLTYPE CJsonObject::AddString(LPCWSTR wszName, LPCWSTR wszValue)
{
    return AddString(WideToNarrow(wszName), wszValue);
}

HRESULT STDMETHODCALLTYPE CJsonObject::AddString(LPCWSTR wszName, LPCSTR szValue)
{
    return AddString(WideToNarrow(wszName), szValue);
}

HRESULT STDMETHODCALLTYPE CJsonObject::AddObject(LPCWSTR wszName, IJsonObject *pChild)
{
    return AddChildText(pChild, [&](LPCSTR szText, DWORD cbText) {
        return static_cast<IJsonObject *>(this)->AddRawJson(wszName, szText, cbText);
    });
}

HRESULT STDMETHODCALLTYPE CJsonObject::AddRawJson(LPCWSTR wszName, LPCSTR szText, DWORD cbText)
{
    return AddRawJson(WideToNarrow(wszName), szText, cbText);
}

HRESULT STDMETHODCALLTYPE CJsonObject::GetJson(LPSTR *pszText, DWORD *pcbText)
{
    if (pszText == nullptr || pcbText == nullptr)
    {
        return E_POINTER;
    }
    *pszText = nullptr;
    *pcbText = 0;
    if (m_pNode == nullptr)
    {
        return E_UNEXPECTED;
    }
    std::string strText;
    m_pNode->ToString(strText);
    // The length with its terminator must fit the DWORD handed back.
    if (strText.size() >= 0xFFFFFFFFull)
    {
        return E_OUTOFMEMORY;
    }
    LPSTR szText = static_cast<LPSTR>(CoTaskMemAlloc(strText.size() + 1));
    if (szText == nullptr)
    {
        TelvaneTraceFailure("CJsonObject::GetJson() - CoTaskMemAlloc", E_OUTOFMEMORY);
        return E_OUTOFMEMORY;
    }
    std::memcpy(szText, strText.c_str(), strText.size() + 1);
    *pszText = szText;
    *pcbText = static_cast<DWORD>(strText.size() + 1);
    return S_OK;
}

template <class FAddRaw>
HRESULT CJsonObject::AddChildText(IJsonObject *pChild, FAddRaw addRaw)
{
    if (pChild == nullptr)
    {
        return E_POINTER;
    }
    LPSTR szText = nullptr;
    DWORD cbText = 0;
    HRESULT hr = pChild->GetJson(&szText, &cbText);
    if (FAILED(hr))
    {
        return hr;
    }
    hr = addRaw(szText, cbText);
    CoTaskMemFree(szText);
    return hr;
}

HRESULT CJsonObject::AddDword(std::string strName, DWORD dwValue)
{
    return AppendValue(std::move(strName), new JsonUInt32(dwValue));
}

HRESULT CJsonObject::AddUlonglong(std::string strName, ULONGLONG ullValue)
{
    return AppendValue(std::move(strName), new JsonUInt64(ullValue));
}

HRESULT CJsonObject::AddDouble(std::string strName, double dblValue)
{
    return AppendValue(std::move(strName), new JsonDouble(dblValue));
}

HRESULT CJsonObject::AddBool(std::string strName, bool fValue)
{
    return AppendValue(std::move(strName), new JsonBool(fValue));
}

HRESULT CJsonObject::AddString(std::string strName, LPCWSTR wszValue)
{
    if (wszValue == nullptr)
    {
        return E_POINTER;
    }
    return AppendValue(std::move(strName), new JsonQuotedString(WideToNarrow(wszValue)));
}

HRESULT CJsonObject::AddString(std::string strName, LPCSTR szValue)
{
    if (szValue == nullptr)
    {
        return E_POINTER;
    }
    return AppendValue(std::move(strName), new JsonQuotedString(szValue));
}

HRESULT CJsonObject::AddGuid(std::string strName, const GUID &guid)
{
    return AppendValue(std::move(strName), new JsonQuotedString(GuidToString(guid)));
}

HRESULT CJsonObject::AddObject(std::string strName, IJsonObject *pChild)
{
    return AddChildText(pChild, [&](LPCSTR szText, DWORD cbText) {
        return AddRawJson(std::move(strName), szText, cbText);
    });
}

HRESULT CJsonObject::AddRawJson(std::string strName, LPCSTR szText, DWORD cbText)
{
    if (szText == nullptr)
    {
        return E_POINTER;
    }
    size_t cchText;
    if (cbText == 0)
    {
        cchText = std::strlen(szText);
    }
    else
    {
        if (szText[cbText - 1] != '\0')
        {
            TelvaneTrace("**Event sent that is not null terminated,  this is safe but a perf hit");
        }
        // Up to the first terminator, and never past the cbText bytes the caller owns.
        const void *pvZero = std::memchr(szText, '\0', cbText);
        cchText =
            pvZero != nullptr ? static_cast<size_t>(static_cast<LPCSTR>(pvZero) - szText) : cbText;
    }
    return AppendValue(std::move(strName), new JsonRawText(std::string(szText, cchText)));
}

HRESULT CJsonObject::AddArray(std::string strName, CJsonArray *pArray)
{
    if (pArray == nullptr)
    {
        return E_POINTER;
    }
    if (m_pNode == nullptr || pArray->m_pNode == nullptr)
    {
        return E_UNEXPECTED;
    }
    JsonArrayNode *pNode = pArray->m_pNode;
    pArray->m_pNode = nullptr;
    m_pNode->Append(std::move(strName), pNode);
    return S_OK;
}

std::string &CJsonObject::ToString(std::string &strOut) const
{
    if (m_pNode == nullptr)
    {
        strOut.clear();
        return strOut;
    }
    return m_pNode->ToString(strOut);
}

CJsonArray::CJsonArray()
    : m_pNode(new JsonArrayNode())
{
}

CJsonArray::~CJsonArray()
{
    delete m_pNode;
}

ULONG CJsonArray::AddRef(ULONG ulTag)
{
    return JsonHolderAddRef(m_refs, ulTag, L"CJsonArray::AddRef");
}

ULONG CJsonArray::Release(ULONG ulTag)
{
    ULONG cRef = JsonHolderRelease(m_refs, ulTag, L"CJsonArray::Release");
    if (cRef == 0)
    {
        delete this;
    }
    return cRef;
}

HRESULT CJsonArray::AddObject(CJsonObject *pObject)
{
    if (pObject == nullptr)
    {
        return E_POINTER;
    }
    HRESULT hr = E_UNEXPECTED;
    if (m_pNode != nullptr && pObject->m_pNode != nullptr)
    {
        JsonObjectNode *pNode = pObject->m_pNode;
        pObject->m_pNode = nullptr;
        m_pNode->Append(pNode);
        hr = S_OK;
    }
    pObject->Release(0);
    return hr;
}
