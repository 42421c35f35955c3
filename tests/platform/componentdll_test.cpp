// The platform component DLL's entry points, loaded directly: which class and interfaces it
// answers, and that it never agrees to be unloaded while an object or a lock is out. Runs on
// the test's main thread, which loads and frees the DLL.
#include "platform/component/platformcomponent.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>

namespace
{
const GUID c_guidOther = {
    0x11111111, 0x2222, 0x3333, {0x44, 0x44, 0x55, 0x55, 0x55, 0x55, 0x55, 0x55}};
} // namespace

TEST(PlatformComponentDll, AnswersOnlyItsClassAndNeverUnloadsWithAnObjectOrALockOut)
{
    HMODULE hModule = LoadLibraryW((testsupport::BinDir() + L"platformcomponent.dll").c_str());
    ASSERT_NE(nullptr, hModule) << GetLastError();
    auto pfnGetClassObject = reinterpret_cast<HRESULT(STDAPICALLTYPE *)(REFCLSID, REFIID, void **)>(
        reinterpret_cast<void *>(GetProcAddress(hModule, "DllGetClassObject")));
    auto pfnCanUnloadNow = reinterpret_cast<HRESULT(STDAPICALLTYPE *)()>(
        reinterpret_cast<void *>(GetProcAddress(hModule, "DllCanUnloadNow")));
    ASSERT_TRUE(pfnGetClassObject != nullptr && pfnCanUnloadNow != nullptr);

    struct Case
    {
        const char *szWhat;
        const CLSID *pClsid;
        const IID *pIid;
        HRESULT hrExpected;
    };
    const Case rgCases[] = {
        {"factory", &CLSID_PlatformComponent, &IID_IClassFactory, S_OK},
        {"factory as IUnknown", &CLSID_PlatformComponent, &IID_IUnknown, S_OK},
        {"the object's interface asked of the factory", &CLSID_PlatformComponent,
         &IID_IPlatformComponent, E_NOINTERFACE},
        {"another class", &c_guidOther, &IID_IClassFactory, CLASS_E_CLASSNOTAVAILABLE},
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(c.szWhat);
        IUnknown *pUnknown = reinterpret_cast<IUnknown *>(1);
        EXPECT_EQ(c.hrExpected,
                  pfnGetClassObject(*c.pClsid, *c.pIid, reinterpret_cast<void **>(&pUnknown)));
        EXPECT_EQ(SUCCEEDED(c.hrExpected), pUnknown != nullptr);
        if (pUnknown != nullptr)
        {
            pUnknown->Release();
        }
    }

    EXPECT_EQ(S_OK, pfnCanUnloadNow());
    IClassFactory *pFactory = nullptr;
    ASSERT_EQ(S_OK, pfnGetClassObject(CLSID_PlatformComponent, IID_IClassFactory,
                                      reinterpret_cast<void **>(&pFactory)));
    IUnknown *pUnknown = nullptr;
    EXPECT_EQ(
        CLASS_E_NOAGGREGATION,
        pFactory->CreateInstance(pFactory, IID_IUnknown, reinterpret_cast<void **>(&pUnknown)));
    EXPECT_EQ(E_NOINTERFACE,
              pFactory->CreateInstance(nullptr, c_guidOther, reinterpret_cast<void **>(&pUnknown)));
    EXPECT_EQ(nullptr, pUnknown);
    ASSERT_EQ(S_OK, pFactory->CreateInstance(nullptr, IID_IUnknown,
                                             reinterpret_cast<void **>(&pUnknown)));
    IPlatformComponent *rgp[2] = {};
    ASSERT_EQ(S_OK,
              pUnknown->QueryInterface(IID_IPlatformComponent, reinterpret_cast<void **>(&rgp[0])));
    pUnknown->Release();
    IClassFactory *pNotFactory = nullptr;
    EXPECT_EQ(E_NOINTERFACE,
              rgp[0]->QueryInterface(IID_IClassFactory, reinterpret_cast<void **>(&pNotFactory)));
    ASSERT_EQ(S_OK, pFactory->CreateInstance(nullptr, IID_IPlatformComponent,
                                             reinterpret_cast<void **>(&rgp[1])));
    ULONG cObjects = 0;
    EXPECT_EQ(S_OK, rgp[0]->GetObjectCount(&cObjects));
    EXPECT_EQ(2u, cObjects);
    EXPECT_EQ(S_FALSE, pfnCanUnloadNow());
    rgp[0]->Release();
    EXPECT_EQ(S_FALSE, pfnCanUnloadNow());
    EXPECT_EQ(S_OK, rgp[1]->GetObjectCount(&cObjects));
    EXPECT_EQ(1u, cObjects);
    rgp[1]->Release();
    EXPECT_EQ(S_OK, pfnCanUnloadNow());

    EXPECT_EQ(S_OK, pFactory->LockServer(TRUE));
    EXPECT_EQ(S_FALSE, pfnCanUnloadNow());
    EXPECT_EQ(S_OK, pFactory->LockServer(FALSE));
    EXPECT_EQ(S_OK, pfnCanUnloadNow());
    pFactory->Release();
    FreeLibrary(hModule);
}
