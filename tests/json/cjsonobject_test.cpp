// The reference-counted holders: builders, the COM interface as a client sees it, the
// tagged counts, and moving nodes between holders as the trace document does. Each test
// owns its holders on its main thread.
#include "lib/cjsonobject.h"
#include "tests/common/testsupport.h"
#include "tests/common/tracesession.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>

using testsupport::FailureCapture;

namespace
{
std::string Text(const CJsonObject *pObject)
{
    std::string str;
    return pObject->ToString(str);
}

// GetJson's text, checked against its length; "<hr>" on failure.
std::string Json(IJsonObject *pObject)
{
    LPSTR szText = nullptr;
    DWORD cbText = 0;
    HRESULT hr = pObject->GetJson(&szText, &cbText);
    if (FAILED(hr))
    {
        EXPECT_EQ(nullptr, szText);
        EXPECT_EQ(0u, cbText);
        return "<" + std::to_string(static_cast<unsigned long>(hr)) + ">";
    }
    std::string str(szText);
    EXPECT_EQ(str.size() + 1, cbText);
    CoTaskMemFree(szText);
    return str;
}

// {01234567-89AB-CDEF-0123-456789ABCDEF}
const GUID c_guidSample = {
    0x01234567, 0x89AB, 0xCDEF, {0x01, 0x23, 0x45, 0x67, 0x89, 0xAB, 0xCD, 0xEF}};
} // namespace

TEST(CJsonObject, WideTextConvertsOrBecomesError)
{
    EXPECT_EQ("\xe9t\xe9", WideToNarrow(L"\x00e9t\x00e9")); // the ANSI code page, not UTF-8
    EXPECT_EQ("error", WideToNarrow(nullptr));
    EXPECT_EQ("", WideToNarrow(L""));
    // 255 bytes and the terminator fit the 256-byte buffer; one more does not.
    EXPECT_EQ(std::string(255, 'n'), WideToNarrow(std::wstring(255, L'n').c_str()));
    EXPECT_EQ("error", WideToNarrow(std::wstring(256, L'n').c_str()));

    CJsonObject *pObject = new CJsonObject();
    EXPECT_EQ(S_OK, pObject->AddDword(std::wstring(300, L'n').c_str(), 1));
    EXPECT_EQ(S_OK, pObject->AddString(L"long", std::wstring(300, L'v').c_str()));
    EXPECT_EQ(S_OK, pObject->AddString("long2", std::wstring(256, L'v').c_str()));
    EXPECT_EQ("{\"error\":1,\"long\":\"error\",\"long2\":\"error\"}", Json(pObject));
    pObject->Release();
}

TEST(CJsonObject, AddObjectTakesTheChildTextAtThatMoment)
{
    testsupport::CTraceSession session;
    CJsonObject *pParent = new CJsonObject();
    CJsonObject *pChild = new CJsonObject();
    pChild->AddDword("a", 1);
    EXPECT_EQ(S_OK, pParent->AddObject(L"c", pChild));
    EXPECT_EQ(S_OK, pParent->AddObject("d", pChild));
    pChild->AddDword("b", 2);
    EXPECT_EQ(S_OK, pParent->AddObject(L"e", pChild));
    EXPECT_EQ(S_OK, pParent->AddObject(L"self", pParent)); // its own text so far
    EXPECT_EQ("{\"c\":{\"a\":1},\"d\":{\"a\":1},\"e\":{\"a\":1,\"b\":2},"
              "\"self\":{\"c\":{\"a\":1},\"d\":{\"a\":1},\"e\":{\"a\":1,\"b\":2}}}",
              Json(pParent));
    // The child's text carries its terminator: no trace line.
    EXPECT_TRUE(session.Lines().empty());
    EXPECT_EQ(1, pChild->RefCount());

    // A child that cannot give its text: the code comes back and nothing is added.
    CJsonArray *pArray = new CJsonArray();
    pChild->AddRef(1);
    EXPECT_EQ(S_OK, pArray->AddObject(pChild));
    EXPECT_EQ("<" + std::to_string(static_cast<unsigned long>(E_UNEXPECTED)) + ">", Json(pChild));
    EXPECT_EQ(E_UNEXPECTED, pParent->AddObject(L"gone", pChild));
    EXPECT_EQ(E_UNEXPECTED, pParent->AddObject("gone", pChild));
    EXPECT_EQ(std::string::npos, Json(pParent).find("gone"));
    EXPECT_EQ(0u, pChild->Release(1));
    EXPECT_EQ(0u, pArray->Release(0));
    EXPECT_EQ(0u, pParent->Release());
}

TEST(CJsonObject, QueryInterfaceSlotOrderBuildersAndGetJson)
{
    CJsonObject *pObject = new CJsonObject();
    IJsonObject *pInterface = pObject;
    EXPECT_EQ("{}", Json(pObject));
    LPSTR szText = nullptr;
    DWORD cbText = 0;
    EXPECT_EQ(E_POINTER, pObject->GetJson(nullptr, &cbText));
    EXPECT_EQ(E_POINTER, pObject->GetJson(&szText, nullptr));
    EXPECT_EQ(E_POINTER, pObject->AddString("none", static_cast<LPCWSTR>(nullptr)));
    EXPECT_EQ(E_POINTER, pObject->AddString(L"none", static_cast<LPCSTR>(nullptr)));
    EXPECT_EQ(E_POINTER, pObject->AddRawJson("none", nullptr, 0));
    EXPECT_EQ(E_POINTER, pObject->AddObject("none", nullptr));
    EXPECT_EQ(E_POINTER, pObject->AddArray("none", nullptr));

    void *pv = nullptr;
    EXPECT_EQ(S_OK, pInterface->QueryInterface(IID_IUnknown, &pv));
    EXPECT_EQ(static_cast<IUnknown *>(pInterface), pv);
    EXPECT_EQ(S_OK, pInterface->QueryInterface(IID_IJsonObject, &pv));
    EXPECT_EQ(pInterface, pv);
    EXPECT_EQ(3, pObject->TagCount(0));
    EXPECT_EQ(3, pObject->RefCount());

    pv = &pv;
    EXPECT_EQ(E_NOINTERFACE, pInterface->QueryInterface(IID_IDispatch, &pv));
    EXPECT_EQ(nullptr, pv);
    const IID iidAlmost = {
        0x35365921, 0x6920, 0x4683, {0x98, 0x4A, 0xAC, 0x37, 0x96, 0x29, 0x68, 0x19}};
    pv = &pv;
    EXPECT_EQ(E_NOINTERFACE, pInterface->QueryInterface(iidAlmost, &pv));
    EXPECT_EQ(nullptr, pv);
    {
        FailureCapture failures;
        EXPECT_EQ(E_POINTER, pInterface->QueryInterface(IID_IJsonObject, nullptr));
        ASSERT_EQ(1u, failures.Count());
        EXPECT_TRUE(failures.Contains(L"lib/cjsonobject.cpp("));
        EXPECT_TRUE(failures.Contains(L"Assertion failure: FALSE"));
    }
    EXPECT_EQ(3, pObject->RefCount());

    // The interface as a C client sees it: slots by position, not by name.
    typedef HRESULT(STDMETHODCALLTYPE * PFN_QI)(IJsonObject *, REFIID, void **);
    typedef ULONG(STDMETHODCALLTYPE * PFN_REF)(IJsonObject *);
    typedef HRESULT(STDMETHODCALLTYPE * PFN_DWORD)(IJsonObject *, LPCWSTR, DWORD);
    typedef HRESULT(STDMETHODCALLTYPE * PFN_WSTR)(IJsonObject *, LPCWSTR, LPCWSTR);
    typedef HRESULT(STDMETHODCALLTYPE * PFN_STR)(IJsonObject *, LPCWSTR, LPCSTR);
    typedef HRESULT(STDMETHODCALLTYPE * PFN_OBJ)(IJsonObject *, LPCWSTR, IJsonObject *);
    typedef HRESULT(STDMETHODCALLTYPE * PFN_RAW)(IJsonObject *, LPCWSTR, LPCSTR, DWORD);
    typedef HRESULT(STDMETHODCALLTYPE * PFN_GET)(IJsonObject *, LPSTR *, DWORD *);
    void **rgpfn = *reinterpret_cast<void ***>(pInterface);

    CJsonObject *pChild = new CJsonObject();
    pChild->AddBool("k", false);
    EXPECT_EQ(E_NOINTERFACE,
              reinterpret_cast<PFN_QI>(rgpfn[0])(pInterface, IID_IClassFactory, &pv));
    EXPECT_EQ(4u, reinterpret_cast<PFN_REF>(rgpfn[1])(pInterface));
    EXPECT_EQ(3u, reinterpret_cast<PFN_REF>(rgpfn[2])(pInterface));
    EXPECT_EQ(S_OK, reinterpret_cast<PFN_DWORD>(rgpfn[3])(pInterface, L"dword", 3));
    EXPECT_EQ(S_OK, reinterpret_cast<PFN_DWORD>(rgpfn[4])(pInterface, L"ulong", 4));
    EXPECT_EQ(S_OK, reinterpret_cast<PFN_WSTR>(rgpfn[5])(pInterface, L"wide", L"w"));
    EXPECT_EQ(S_OK, reinterpret_cast<PFN_STR>(rgpfn[6])(pInterface, L"narrow", "n"));
    EXPECT_EQ(S_OK, reinterpret_cast<PFN_OBJ>(rgpfn[7])(pInterface, L"object", pChild));
    EXPECT_EQ(S_OK, reinterpret_cast<PFN_RAW>(rgpfn[8])(pInterface, L"raw", "[7]", 4));
    // The builders the service calls by narrow name.
    EXPECT_EQ(S_OK, pObject->AddDword("d", 4000000000u));
    EXPECT_EQ(S_OK, pObject->AddUlonglong("t", 133000000000000000ull));
    EXPECT_EQ(S_OK, pObject->AddDouble("x", 6.0));
    EXPECT_EQ(S_OK, pObject->AddString("w", L"wide/\x00e9"));
    EXPECT_EQ(S_OK, pObject->AddString("n", "narrow\n"));
    EXPECT_EQ(S_OK, pObject->AddGuid("g", c_guidSample));
    EXPECT_EQ(S_OK, pObject->AddRawJson("r", "[1, 2]", 0));
    ASSERT_EQ(S_OK, reinterpret_cast<PFN_GET>(rgpfn[9])(pInterface, &szText, &cbText));
    const std::string strExpected =
        "{\"dword\":3,\"ulong\":4,\"wide\":\"w\",\"narrow\":\"n\",\"object\":{\"k\":false},"
        "\"raw\":[7],\"d\":4000000000,\"t\":133000000000000000,\"x\":6,\"w\":\"wide\\/"
        "\\u00e9\",\"n\":\"narrow\\n\",\"g\":\"01234567-89ab-cdef-0123-456789abcdef\",\"r\":[1, "
        "2]}";
    EXPECT_EQ(strExpected, szText);
    EXPECT_EQ(strlen(szText) + 1, cbText);
    CoTaskMemFree(szText);
    EXPECT_EQ(strExpected, Text(pObject));

    pChild->Release();
    EXPECT_EQ(2u, pInterface->Release());
    EXPECT_EQ(1u, pInterface->Release());
    EXPECT_EQ(0u, pInterface->Release());
}

// Both holders count six tags. A release under a tag that holds nothing is reported in the
// holder's name, and (as under a debugger) the total still falls; a tag past the six is
// reported without touching any count.
TEST(CJsonObject, TaggedReferences)
{
    FailureCapture failures;
    CJsonObject *pObject = new CJsonObject();
    EXPECT_EQ(2u, pObject->AddRef(1));
    EXPECT_EQ(3u, pObject->AddRef(5));
    EXPECT_EQ(2u, pObject->Release(5));
    EXPECT_EQ(1u, pObject->Release(2));
    ASSERT_EQ(1u, failures.Count());
    EXPECT_TRUE(failures.Contains(L"CJsonObject::Release: Fatal error"));
    EXPECT_TRUE(failures.Contains(L"from Release"));
    EXPECT_EQ(-1, pObject->TagCount(2));
    EXPECT_EQ(1u, pObject->AddRef(6));
    EXPECT_EQ(1u, pObject->Release(6));
    EXPECT_EQ(3u, failures.Count());
    EXPECT_TRUE(failures.Contains(L"CJsonObject::AddRef: Fatal error"));
    EXPECT_EQ(0u, pObject->Release(1));

    CJsonArray *pArray = new CJsonArray();
    pArray->AddRef(3);
    EXPECT_EQ(1u, pArray->Release(4));
    EXPECT_TRUE(failures.Contains(L"CJsonArray::Release: Fatal error"));
    EXPECT_EQ(1u, pArray->AddRef(7));
    EXPECT_EQ(1u, pArray->Release(7));
    EXPECT_EQ(6u, failures.Count());
    EXPECT_TRUE(failures.Contains(L"CJsonArray::AddRef: Fatal error"));
    EXPECT_EQ(0u, pArray->Release(3));
    EXPECT_EQ(6u, failures.Count());
}

TEST(CJsonArray, NodesMoveIntoTheTraceDocument)
{
    CTaggedPtr<CJsonObject, 1> trace;
    trace = new CJsonObject();
    trace->Release(0);
    trace->AddGuid("ActivityID", c_guidSample);

    CTaggedPtr<CJsonArray, 1> group;
    group = new CJsonArray();
    group->Release(0);
    for (ULONG i = 0; i < 3; i++)
    {
        CJsonObject *pRecord = new CJsonObject();
        pRecord->AddRef(2); // watch it after the move
        pRecord->AddUlonglong("TimeStamp", 100 + i);
        pRecord->AddRawJson("Value", "{\"e\":1}", 8);
        EXPECT_EQ(S_OK, group->AddObject(pRecord));
        // The caller's tag-0 reference is gone, and so is the node.
        EXPECT_EQ(0, pRecord->TagCount(0));
        EXPECT_EQ(1, pRecord->RefCount());
        EXPECT_EQ(E_UNEXPECTED, pRecord->AddDword("late", 1));
        EXPECT_EQ(E_UNEXPECTED, pRecord->AddDword(L"late", 1));
        EXPECT_EQ(E_UNEXPECTED, pRecord->AddArray("late", group));
        EXPECT_EQ("", Text(pRecord));
        EXPECT_EQ(0u, pRecord->Release(2));
    }
    // A record whose node is gone: nothing is added, the caller's reference still goes.
    CJsonObject *pMoved = new CJsonObject();
    pMoved->AddRef(2);
    group->AddObject(pMoved);
    pMoved->AddRef(0);
    EXPECT_EQ(E_UNEXPECTED, group->AddObject(pMoved));
    EXPECT_EQ(1, pMoved->RefCount());
    EXPECT_EQ(0u, pMoved->Release(2));

    EXPECT_EQ(S_OK, trace->AddArray("ID" + GuidToString(c_guidSample), group));
    trace->AddBool("LogEnd", true);

    // The array's node now belongs to the trace: both ways of adding again fail.
    EXPECT_EQ(E_UNEXPECTED, trace->AddArray("again", group));
    CJsonObject *pLate = new CJsonObject();
    pLate->AddRef(1);
    EXPECT_EQ(E_UNEXPECTED, group->AddObject(pLate));
    EXPECT_EQ(0, pLate->TagCount(0));
    EXPECT_EQ(0u, pLate->Release(1));
    group.Release();

    EXPECT_EQ("{\"ActivityID\":\"01234567-89ab-cdef-0123-456789abcdef\","
              "\"ID01234567-89ab-cdef-0123-456789abcdef\":[{\"TimeStamp\":100,\"Value\":{\"e\":1}},"
              "{\"TimeStamp\":101,\"Value\":{\"e\":1}},{\"TimeStamp\":102,\"Value\":{\"e\":1}},{}],"
              "\"LogEnd\":true}",
              Text(trace));
}
