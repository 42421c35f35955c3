// The DLL's entry points: the class object for COM, and self-registration for regsvr32.
#include "platform/component/platformcomponent.h"

#include "inc/handleholder.h"
#include "platform/component/componentmodule.h"
#include "platform/component/cplatformcomponentfactory.h"

#include <string>

namespace
{
// Machine-wide, which is where HKEY_CLASSES_ROOT writes of an administrator land anyway;
// naming it keeps per-user classes out of it.
const wchar_t c_wszClassKey[] = L"Software\\Classes\\CLSID\\{B5368813-926B-449C-9676-DB6ED6F8F428}";
const wchar_t c_wszClassName[] = L"Telvane platform component";
// Both: created in the caller's apartment, so a service's thread-pool thread in the
// process's MTA gets the object itself, not a proxy to some other apartment.
const wchar_t c_wszThreadingModel[] = L"Both";

LONG ComponentSetString(HKEY hKey, const wchar_t *wszName, const wchar_t *wszValue)
{
    return RegSetValueExW(hKey, wszName, 0, REG_SZ, reinterpret_cast<const BYTE *>(wszValue),
                          static_cast<DWORD>((wcslen(wszValue) + 1) * sizeof(wchar_t)));
}

// The DLL's own full path, whatever its length.
LONG ComponentModulePath(std::wstring *pwstrPath)
{
    std::wstring wstr(MAX_PATH, L'\0');
    for (;;)
    {
        DWORD cch =
            GetModuleFileNameW(ComponentModuleHandle(), &wstr[0], static_cast<DWORD>(wstr.size()));
        if (cch == 0)
        {
            return static_cast<LONG>(GetLastError());
        }
        if (cch < wstr.size())
        {
            wstr.resize(cch);
            *pwstrPath = wstr;
            return ERROR_SUCCESS;
        }
        if (wstr.size() >= 32768)
        {
            return ERROR_INSUFFICIENT_BUFFER;
        }
        wstr.resize(wstr.size() * 2);
    }
}

LONG ComponentRegister()
{
    std::wstring wstrPath;
    LONG lError = ComponentModulePath(&wstrPath);
    if (lError != ERROR_SUCCESS)
    {
        return lError;
    }
    CRegKeyHandle hClass;
    lError =
        RegCreateKeyExW(HKEY_LOCAL_MACHINE, c_wszClassKey, 0, nullptr, REG_OPTION_NON_VOLATILE,
                        KEY_SET_VALUE | KEY_CREATE_SUB_KEY, nullptr, hClass.Receive(), nullptr);
    if (lError != ERROR_SUCCESS)
    {
        return lError;
    }
    lError = ComponentSetString(hClass.Get(), nullptr, c_wszClassName);
    if (lError != ERROR_SUCCESS)
    {
        return lError;
    }
    CRegKeyHandle hServer;
    lError = RegCreateKeyExW(hClass.Get(), L"InprocServer32", 0, nullptr, REG_OPTION_NON_VOLATILE,
                             KEY_SET_VALUE, nullptr, hServer.Receive(), nullptr);
    if (lError != ERROR_SUCCESS)
    {
        return lError;
    }
    lError = ComponentSetString(hServer.Get(), nullptr, wstrPath.c_str());
    if (lError != ERROR_SUCCESS)
    {
        return lError;
    }
    return ComponentSetString(hServer.Get(), L"ThreadingModel", c_wszThreadingModel);
}

LONG ComponentUnregister()
{
    LONG lError = RegDeleteTreeW(HKEY_LOCAL_MACHINE, c_wszClassKey);
    return lError == ERROR_FILE_NOT_FOUND ? ERROR_SUCCESS : lError;
}
} // namespace

extern "C" BOOL WINAPI DllMain(HINSTANCE hInstance, DWORD dwReason, LPVOID pvReserved)
{
    if (dwReason == DLL_PROCESS_ATTACH)
    {
        ComponentModuleSetHandle(hInstance);
        DisableThreadLibraryCalls(hInstance);
    }
    return TRUE;
}

STDAPI DllGetClassObject(REFCLSID rclsid, REFIID riid, LPVOID *ppv)
{
    if (ppv == nullptr)
    {
        return E_POINTER;
    }
    *ppv = nullptr;
    if (!IsEqualCLSID(rclsid, CLSID_PlatformComponent))
    {
        return CLASS_E_CLASSNOTAVAILABLE;
    }
    return CPlatformComponentFactory::s_factory.QueryInterface(riid, ppv);
}

STDAPI DllCanUnloadNow()
{
    return ComponentModuleCanUnload() ? S_OK : S_FALSE;
}

STDAPI DllRegisterServer()
{
    LONG lError = ComponentRegister();
    if (lError != ERROR_SUCCESS)
    {
        // No half registration: a class key without a server would only fail later, and
        // further from the cause.
        ComponentUnregister();
        return HRESULT_FROM_WIN32(lError);
    }
    return S_OK;
}

STDAPI DllUnregisterServer()
{
    LONG lError = ComponentUnregister(); // HRESULT_FROM_WIN32 may evaluate it twice
    return HRESULT_FROM_WIN32(lError);
}
