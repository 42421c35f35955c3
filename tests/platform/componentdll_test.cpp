// The platform component DLL's entry points, loaded directly: which class and interfaces it
// answers, and that it never agrees to be unloaded while an object or a lock is out.
#include "platform/component/platformcomponent.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>

namespace
{
typedef HRESULT(STDAPICALLTYPE *PFN_GET_CLASS_OBJECT)(REFCLSID, REFIID, LPVOID *);
typedef HRESULT(STDAPICALLTYPE *PFN_CAN_UNLOAD_NOW)();

// Loads the DLL for one test on the test's main thread and frees it afterwards.
class PlatformComponentDll : public ::testing::Test
{
protected:
    void SetUp() override
    {
        m_hModule = LoadLibraryW((testsupport::BinDir() + L"platformcomponent.dll").c_str());
        ASSERT_NE(nullptr, m_hModule) << GetLastError();
        m_pfnGetClassObject = reinterpret_cast<PFN_GET_CLASS_OBJECT>(
            reinterpret_cast<void *>(GetProcAddress(m_hModule, "DllGetClassObject")));
        m_pfnCanUnloadNow = reinterpret_cast<PFN_CAN_UNLOAD_NOW>(
            reinterpret_cast<void *>(GetProcAddress(m_hModule, "DllCanUnloadNow")));
        ASSERT_NE(nullptr, m_pfnGetClassObject);
        ASSERT_NE(nullptr, m_pfnCanUnloadNow);
    }
    void TearDown() override
    {
        if (m_hModule != nullptr)
        {
            FreeLibrary(m_hModule);
        }
    }

    HMODULE m_hModule = nullptr;
    PFN_GET_CLASS_OBJECT m_pfnGetClassObject = nullptr;
    PFN_CAN_UNLOAD_NOW m_pfnCanUnloadNow = nullptr;
};

const GUID c_guidOther = {
    0x11111111, 0x2222, 0x3333, {0x44, 0x44, 0x55, 0x55, 0x55, 0x55, 0x55, 0x55}};
} // namespace

TEST_F(PlatformComponentDll, AnswersOnlyItsClassAndInterfaces)
{
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
        IUnknown *pUnknown = reinterpret_cast<IUnknown *>(1);
        EXPECT_EQ(c.hrExpected,
                  m_pfnGetClassObject(*c.pClsid, *c.pIid, reinterpret_cast<void **>(&pUnknown)))
            << c.szWhat;
        if (SUCCEEDED(c.hrExpected))
        {
            ASSERT_NE(nullptr, pUnknown) << c.szWhat;
            pUnknown->Release();
        }
        else
        {
            EXPECT_EQ(nullptr, pUnknown) << c.szWhat;
        }
    }

    IClassFactory *pFactory = nullptr;
    ASSERT_EQ(S_OK, m_pfnGetClassObject(CLSID_PlatformComponent, IID_IClassFactory,
                                        reinterpret_cast<void **>(&pFactory)));
    IUnknown *pOuter = reinterpret_cast<IUnknown *>(pFactory);
    IUnknown *pUnknown = nullptr;
    EXPECT_EQ(CLASS_E_NOAGGREGATION,
              pFactory->CreateInstance(pOuter, IID_IUnknown, reinterpret_cast<void **>(&pUnknown)));
    EXPECT_EQ(E_NOINTERFACE,
              pFactory->CreateInstance(nullptr, c_guidOther, reinterpret_cast<void **>(&pUnknown)));
    EXPECT_EQ(nullptr, pUnknown);
    ASSERT_EQ(S_OK, pFactory->CreateInstance(nullptr, IID_IUnknown,
                                             reinterpret_cast<void **>(&pUnknown)));
    IPlatformComponent *pComponent = nullptr;
    ASSERT_EQ(S_OK, pUnknown->QueryInterface(IID_IPlatformComponent,
                                             reinterpret_cast<void **>(&pComponent)));
    EXPECT_EQ(E_NOINTERFACE,
              pUnknown->QueryInterface(IID_IClassFactory, reinterpret_cast<void **>(&pFactory)));
    pComponent->Release();
    pUnknown->Release();
}

TEST_F(PlatformComponentDll, NeverUnloadsWithAnObjectOrALockOut)
{
    EXPECT_EQ(S_OK, m_pfnCanUnloadNow());
    IClassFactory *pFactory = nullptr;
    ASSERT_EQ(S_OK, m_pfnGetClassObject(CLSID_PlatformComponent, IID_IClassFactory,
                                        reinterpret_cast<void **>(&pFactory)));
    IPlatformComponent *rgp[2] = {};
    for (IPlatformComponent *&p : rgp)
    {
        ASSERT_EQ(S_OK, pFactory->CreateInstance(nullptr, IID_IPlatformComponent,
                                                 reinterpret_cast<void **>(&p)));
    }
    ULONG cObjects = 0;
    EXPECT_EQ(S_OK, rgp[0]->GetObjectCount(&cObjects));
    EXPECT_EQ(2u, cObjects);
    EXPECT_EQ(S_FALSE, m_pfnCanUnloadNow());
    rgp[0]->Release();
    EXPECT_EQ(S_FALSE, m_pfnCanUnloadNow());
    EXPECT_EQ(S_OK, rgp[1]->GetObjectCount(&cObjects));
    EXPECT_EQ(1u, cObjects);
    rgp[1]->Release();
    EXPECT_EQ(S_OK, m_pfnCanUnloadNow());

    EXPECT_EQ(S_OK, pFactory->LockServer(TRUE));
    EXPECT_EQ(S_FALSE, m_pfnCanUnloadNow());
    EXPECT_EQ(S_OK, pFactory->LockServer(FALSE));
    EXPECT_EQ(S_OK, m_pfnCanUnloadNow());
    pFactory->Release();
}
