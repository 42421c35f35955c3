// The reference-counted holders through which the service builds JSON documents (the
// trace, the records of its event groups) and hands them across component boundaries.
#pragma once

#include <windows.h>
#include <unknwn.h>

#include "inc/ctaggedptr.h"
#include "lib/jsonvalue.h"

#include <string>

// {35365921-6920-4683-984A-AC3796296818}
EXTERN_C const IID IID_IJsonObject;

// Slots after IUnknown, in this order: AddDword, AddUlong, AddString (wide value),
// AddString (narrow value), AddObject, AddRawJson, GetJson. Names are wide.
struct IJsonObject : public IUnknown
{
    virtual HRESULT STDMETHODCALLTYPE AddDword(LPCWSTR wszName, DWORD dwValue) = 0;
    virtual HRESULT STDMETHODCALLTYPE AddUlong(LPCWSTR wszName, ULONG ulValue) = 0;
#ifdef _MSC_VER
    // MSVC places overloaded virtual functions in reverse order of declaration; declaring
    // them reversed keeps the wide value in the earlier slot there too.
    virtual HRESULT STDMETHODCALLTYPE AddString(LPCWSTR wszName, LPCSTR szValue) = 0;
    virtual HRESULT STDMETHODCALLTYPE AddString(LPCWSTR wszName, LPCWSTR wszValue) = 0;
#else
    virtual HRESULT STDMETHODCALLTYPE AddString(LPCWSTR wszName, LPCWSTR wszValue) = 0;
    virtual HRESULT STDMETHODCALLTYPE AddString(LPCWSTR wszName, LPCSTR szValue) = 0;
#endif
    // Inserts the child's text as it is now; later changes to the child stay out.
    virtual HRESULT STDMETHODCALLTYPE AddObject(LPCWSTR wszName, IJsonObject *pChild) = 0;
    // szText is one complete JSON value, inserted unchanged. cbText counts the bytes with
    // the terminator; 0 means "up to the terminator".
    virtual HRESULT STDMETHODCALLTYPE AddRawJson(LPCWSTR wszName, LPCSTR szText, DWORD cbText) = 0;
    // The compact text in a CoTaskMemAlloc buffer the caller frees with CoTaskMemFree;
    // *pcbText counts the terminator.
    virtual HRESULT STDMETHODCALLTYPE GetJson(LPSTR *pszText, DWORD *pcbText) = 0;
};

class CJsonArray;

// Owns one object node. Built and read by one thread at a time (its owner's queue);
// references may be taken and dropped on any thread. The creator holds tag 0; documents
// keep it in CTaggedPtr<class CJsonObject,1>, interface clients hold tag 0. Adding to an
// object whose node went into an array fails with E_UNEXPECTED and adds nothing.
class CJsonObject final : public IJsonObject
{
public:
    CJsonObject();

    CJsonObject(const CJsonObject &) = delete;
    CJsonObject &operator=(const CJsonObject &) = delete;

    // IUnknown: the untagged pair counts under tag 0.
    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void **ppvObject) override;
    ULONG STDMETHODCALLTYPE AddRef() override;
    ULONG STDMETHODCALLTYPE Release() override;

    // IJsonObject
    HRESULT STDMETHODCALLTYPE AddDword(LPCWSTR wszName, DWORD dwValue) override;
    HRESULT STDMETHODCALLTYPE AddUlong(LPCWSTR wszName, ULONG ulValue) override;
    HRESULT STDMETHODCALLTYPE AddString(LPCWSTR wszName, LPCWSTR wszValue) override;
    HRESULT STDMETHODCALLTYPE AddString(LPCWSTR wszName, LPCSTR szValue) override;
    HRESULT STDMETHODCALLTYPE AddObject(LPCWSTR wszName, IJsonObject *pChild) override;
    HRESULT STDMETHODCALLTYPE AddRawJson(LPCWSTR wszName, LPCSTR szText, DWORD cbText) override;
    HRESULT STDMETHODCALLTYPE GetJson(LPSTR *pszText, DWORD *pcbText) override;

    // Tagged references, tags 0 to 5. Releasing a tag that holds nothing is a fatal error;
    // the last release deletes the object and its node.
    ULONG AddRef(ULONG ulTag);
    ULONG Release(ULONG ulTag);

    // The service's own builders, with narrow names.
    HRESULT AddDword(std::string strName, DWORD dwValue);
    HRESULT AddUlonglong(std::string strName, ULONGLONG ullValue);
    HRESULT AddDouble(std::string strName, double dblValue);
    HRESULT AddBool(std::string strName, bool fValue);
    HRESULT AddString(std::string strName, LPCWSTR wszValue);
    HRESULT AddString(std::string strName, LPCSTR szValue);
    HRESULT AddGuid(std::string strName, const GUID &guid);
    HRESULT AddObject(std::string strName, IJsonObject *pChild);
    HRESULT AddRawJson(std::string strName, LPCSTR szText, DWORD cbText);
    // Moves the array's node into this object; the array keeps its references and is
    // released by its holders as usual.
    HRESULT AddArray(std::string strName, CJsonArray *pArray);

    // The node's compact text; empty once the node went into an array.
    std::string &ToString(std::string &strOut) const;

    long TagCount(ULONG ulTag) const { return m_refs.TagCount(ulTag); }
    long RefCount() const { return m_refs.Total(); }

private:
    friend class CJsonArray;
    ~CJsonObject();

    HRESULT AppendValue(std::string strName, JsonValue *pValue);
    template <class FAddRaw>
    HRESULT AddChildText(IJsonObject *pChild, FAddRaw addRaw);

    JsonObjectNode *m_pNode; // owned; null after the node moved into a CJsonArray
    TaggedRefCount<c_cJsonTags> m_refs;
};

// Owns one array node; the same threading and references as CJsonObject. The trace
// keeps one per event group in CTaggedPtr<class CJsonArray,1>.
class CJsonArray
{
public:
    CJsonArray();

    CJsonArray(const CJsonArray &) = delete;
    CJsonArray &operator=(const CJsonArray &) = delete;

    ULONG AddRef(ULONG ulTag);
    ULONG Release(ULONG ulTag);

    // Moves the object's node to the end of the array and releases the caller's tag-0
    // reference on the object, also when the move fails (E_UNEXPECTED); the object is
    // only released afterwards, never added to.
    HRESULT AddObject(CJsonObject *pObject);

    long TagCount(ULONG ulTag) const { return m_refs.TagCount(ulTag); }
    long RefCount() const { return m_refs.Total(); }

private:
    friend class CJsonObject;
    ~CJsonArray();

    TaggedRefCount<c_cJsonTags> m_refs;
    JsonArrayNode *m_pNode; // owned; null after the node moved into a CJsonObject
};

TAGGED_PTR_CLASS_NAME(CJsonObject);
TAGGED_PTR_CLASS_NAME(CJsonArray);

// Wide text in the system ANSI code page, at most 255 bytes; "error" when it does not
// convert or fit (or is null).
std::string WideToNarrow(LPCWSTR wszText);
// Lower-case 8-4-4-4-12 text without braces; empty when the conversion fails.
std::string GuidToString(const GUID &guid);
