// "telvanectl platform cert": the certificates around the HTTPS JSON client. Imports the
// device certificate into the current user's "MY" store (and removes it), trusts a CA in
// the machine's "Root" store (and stops trusting it), and sets what the certificate
// provisioning stand-in answers.
#include "inc/handleholder.h"
#include "platform/certprovisioning/certprovisioning.h"
#include "tools/telvanectl/ctlcommand.h"

#include <stdio.h>
#include <string.h>
#include <wchar.h>
#include <string>
#include <vector>

namespace
{
// Every imported key gets a container of its own, named after its certificate: imports
// that share the user's default container overwrite each other's keys.
const wchar_t c_wszContainerPrefix[] = L"Telvane-Device-";

const DWORD c_dwEncoding = X509_ASN_ENCODING | PKCS_7_ASN_ENCODING;

struct CryptProvTraits
{
    typedef HCRYPTPROV Type;
    static Type Invalid() { return 0; }
    static BOOL Close(Type h) { return CryptReleaseContext(h, 0); }
};

int CertFailed(const char *szStep)
{
    DWORD dwError = GetLastError();
    fprintf(stderr, "telvanectl: %s failed: 0x%08lx\n", szStep,
            static_cast<unsigned long>(dwError));
    return c_iCtlExitFailed;
}

bool CertReadFile(const wchar_t *wszPath, std::vector<BYTE> &rgb)
{
    CFileHandle hFile(CreateFileW(wszPath, GENERIC_READ, FILE_SHARE_READ, nullptr, OPEN_EXISTING,
                                  FILE_ATTRIBUTE_NORMAL, nullptr));
    if (!hFile)
    {
        return false;
    }
    LARGE_INTEGER size;
    if (!GetFileSizeEx(hFile.Get(), &size) || size.QuadPart > 16 * 1024 * 1024)
    {
        return false;
    }
    rgb.resize(static_cast<size_t>(size.QuadPart));
    DWORD cbRead = 0;
    return rgb.empty() ||
           (ReadFile(hFile.Get(), rgb.data(), static_cast<DWORD>(rgb.size()), &cbRead, nullptr) &&
            cbRead == rgb.size());
}

// A certificate file in DER or PEM form, as a context of its own.
PCCERT_CONTEXT CertLoadFile(const wchar_t *wszPath)
{
    std::vector<BYTE> rgb;
    if (!CertReadFile(wszPath, rgb))
    {
        return nullptr;
    }
    static const char c_szPem[] = "-----BEGIN";
    if (rgb.size() > sizeof(c_szPem) && memcmp(rgb.data(), c_szPem, sizeof(c_szPem) - 1) == 0)
    {
        DWORD cb = 0;
        if (!CryptStringToBinaryA(reinterpret_cast<const char *>(rgb.data()),
                                  static_cast<DWORD>(rgb.size()), CRYPT_STRING_BASE64HEADER,
                                  nullptr, &cb, nullptr, nullptr))
        {
            return nullptr;
        }
        std::vector<BYTE> rgbDer(cb);
        if (!CryptStringToBinaryA(reinterpret_cast<const char *>(rgb.data()),
                                  static_cast<DWORD>(rgb.size()), CRYPT_STRING_BASE64HEADER,
                                  rgbDer.data(), &cb, nullptr, nullptr))
        {
            return nullptr;
        }
        rgb.swap(rgbDer);
        rgb.resize(cb);
    }
    return CertCreateCertificateContext(c_dwEncoding, rgb.data(), static_cast<DWORD>(rgb.size()));
}

HCERTSTORE CertOpenSystem(DWORD dwLocation, const wchar_t *wszName)
{
    return CertOpenStore(CERT_STORE_PROV_SYSTEM_W, c_dwEncoding, 0, dwLocation, wszName);
}

// Wine saves a system store only when it is freed, and a delete alone is not saved at all
// without an explicit commit.
bool CertCommitAndClose(CCertStoreHandle &hStore)
{
    bool fOk = CertControlStore(hStore.Get(), 0, CERT_STORE_CTRL_COMMIT, nullptr) != FALSE;
    return hStore.Close() != FALSE && fOk;
}

bool CertHasDeviceUsage(PCCERT_CONTEXT pCertificate)
{
    DWORD cb = 0;
    if (!CertGetEnhancedKeyUsage(pCertificate, 0, nullptr, &cb) || cb < sizeof(CERT_ENHKEY_USAGE))
    {
        return false;
    }
    std::vector<BYTE> rgb(cb);
    PCERT_ENHKEY_USAGE pUsage = reinterpret_cast<PCERT_ENHKEY_USAGE>(rgb.data());
    if (!CertGetEnhancedKeyUsage(pCertificate, 0, pUsage, &cb))
    {
        return false;
    }
    for (DWORD i = 0; i < pUsage->cUsageIdentifier; i++)
    {
        if (strcmp(pUsage->rgpszUsageIdentifier[i], GOVCPC_DEVICE_CERTIFICATE_USAGE) == 0)
        {
            return true;
        }
    }
    return false;
}

std::vector<BYTE> CertProperty(PCCERT_CONTEXT pCertificate, DWORD dwProperty)
{
    std::vector<BYTE> rgb;
    DWORD cb = 0;
    if (CertGetCertificateContextProperty(pCertificate, dwProperty, nullptr, &cb) && cb > 0)
    {
        rgb.resize(cb);
        if (!CertGetCertificateContextProperty(pCertificate, dwProperty, rgb.data(), &cb))
        {
            rgb.clear();
        }
    }
    return rgb;
}

std::wstring CertSubject(PCCERT_CONTEXT pCertificate)
{
    wchar_t wsz[256] = L"";
    CertGetNameStringW(pCertificate, CERT_NAME_SIMPLE_DISPLAY_TYPE, 0, nullptr, wsz,
                       ARRAYSIZE(wsz));
    return wsz;
}

// Moves the certificate's private key into a container named after the certificate and
// points the certificate at it.
// Returns 0 or the error of the failing step, named in *pszStep (the holders' cleanup may
// change the last error before a caller could read it).
DWORD CertGiveKeyOwnContainer(PCCERT_CONTEXT pCertificate, const char **pszStep)
{
    std::vector<BYTE> rgbInfo = CertProperty(pCertificate, CERT_KEY_PROV_INFO_PROP_ID);
    std::vector<BYTE> rgbHash = CertProperty(pCertificate, CERT_SHA1_HASH_PROP_ID);
    if (rgbInfo.size() < sizeof(CRYPT_KEY_PROV_INFO) || rgbHash.empty())
    {
        *pszStep = "reading the key property";
        return static_cast<DWORD>(NTE_NO_KEY);
    }
    CRYPT_KEY_PROV_INFO info = *reinterpret_cast<const CRYPT_KEY_PROV_INFO *>(rgbInfo.data());
    std::wstring wstrContainer = c_wszContainerPrefix;
    for (BYTE b : rgbHash)
    {
        wchar_t wsz[3];
        swprintf(wsz, 3, L"%02x", b);
        wstrContainer += wsz;
    }

    CHandleHolder<CryptProvTraits> hSource;
    if (!CryptAcquireContextW(hSource.Receive(), info.pwszContainerName, info.pwszProvName,
                              info.dwProvType, 0))
    {
        *pszStep = "acquiring the imported key";
        return GetLastError();
    }
    // The import may record a key type the provider does not know (Wine writes
    // 3); the key pair is then found under one of the two it does.
    HCRYPTKEY hKey = 0;
    if (!CryptGetUserKey(hSource.Get(), info.dwKeySpec, &hKey) &&
        !CryptGetUserKey(hSource.Get(), AT_KEYEXCHANGE, &hKey) &&
        !CryptGetUserKey(hSource.Get(), AT_SIGNATURE, &hKey))
    {
        *pszStep = "CryptGetUserKey";
        return GetLastError();
    }
    DWORD cb = 0;
    std::vector<BYTE> rgbKey;
    BOOL fExported = CryptExportKey(hKey, 0, PRIVATEKEYBLOB, 0, nullptr, &cb);
    if (fExported)
    {
        rgbKey.resize(cb);
        fExported = CryptExportKey(hKey, 0, PRIVATEKEYBLOB, 0, rgbKey.data(), &cb);
    }
    CryptDestroyKey(hKey);
    if (!fExported)
    {
        *pszStep = "CryptExportKey";
        return GetLastError();
    }

    HCRYPTPROV hStale = 0;
    CryptAcquireContextW(&hStale, wstrContainer.c_str(), info.pwszProvName, info.dwProvType,
                         CRYPT_DELETEKEYSET);
    CHandleHolder<CryptProvTraits> hTarget;
    if (!CryptAcquireContextW(hTarget.Receive(), wstrContainer.c_str(), info.pwszProvName,
                              info.dwProvType, CRYPT_NEWKEYSET))
    {
        *pszStep = "creating the key container";
        return GetLastError();
    }
    HCRYPTKEY hImported = 0;
    BOOL fImported = CryptImportKey(hTarget.Get(), rgbKey.data(), cb, 0, 0, &hImported);
    SecureZeroMemory(rgbKey.data(), rgbKey.size());
    if (!fImported)
    {
        *pszStep = "CryptImportKey";
        return GetLastError();
    }
    CryptDestroyKey(hImported);

    info.pwszContainerName = &wstrContainer[0];
    info.dwFlags = 0;
    info.cProvParam = 0;
    info.rgProvParam = nullptr;
    *pszStep = "CertSetCertificateContextProperty";
    return CertSetCertificateContextProperty(pCertificate, CERT_KEY_PROV_INFO_PROP_ID, 0, &info)
               ? ERROR_SUCCESS
               : GetLastError();
}

// True when the certificate's key lives in a container this command made.
bool CertHasOwnContainer(PCCERT_CONTEXT pCertificate, std::vector<BYTE> &rgbInfo)
{
    rgbInfo = CertProperty(pCertificate, CERT_KEY_PROV_INFO_PROP_ID);
    if (rgbInfo.size() < sizeof(CRYPT_KEY_PROV_INFO))
    {
        return false;
    }
    const CRYPT_KEY_PROV_INFO *pInfo =
        reinterpret_cast<const CRYPT_KEY_PROV_INFO *>(rgbInfo.data());
    return pInfo->pwszContainerName != nullptr &&
           wcsncmp(pInfo->pwszContainerName, c_wszContainerPrefix, wcslen(c_wszContainerPrefix)) ==
               0;
}

void CertDeleteOwnContainer(PCCERT_CONTEXT pCertificate)
{
    std::vector<BYTE> rgbInfo;
    if (CertHasOwnContainer(pCertificate, rgbInfo))
    {
        const CRYPT_KEY_PROV_INFO *pInfo =
            reinterpret_cast<const CRYPT_KEY_PROV_INFO *>(rgbInfo.data());
        HCRYPTPROV hProv = 0;
        CryptAcquireContextW(&hProv, pInfo->pwszContainerName, pInfo->pwszProvName,
                             pInfo->dwProvType, CRYPT_DELETEKEYSET);
    }
}

int CertImport(int argc, wchar_t **argv)
{
    if (argc < 1 || argc > 2)
    {
        return CtlCommandUsage("platform cert import takes FILE.pfx and an optional PASSWORD");
    }
    std::vector<BYTE> rgb;
    if (!CertReadFile(argv[0], rgb))
    {
        return CertFailed("reading the PFX file");
    }
    CRYPT_DATA_BLOB blob = {static_cast<DWORD>(rgb.size()), rgb.data()};
    CCertStoreHandle hPfx(
        PFXImportCertStore(&blob, argc > 1 ? argv[1] : L"", CRYPT_EXPORTABLE | CRYPT_USER_KEYSET));
    if (!hPfx)
    {
        return CertFailed("PFXImportCertStore");
    }
    CCertStoreHandle hMy(CertOpenSystem(CERT_SYSTEM_STORE_CURRENT_USER, L"MY"));
    if (!hMy)
    {
        return CertFailed("opening the current user's MY store");
    }
    int cImported = 0;
    PCCERT_CONTEXT pCertificate = nullptr;
    while ((pCertificate = CertEnumCertificatesInStore(hPfx.Get(), pCertificate)) != nullptr)
    {
        if (CertProperty(pCertificate, CERT_KEY_PROV_INFO_PROP_ID).empty())
        {
            continue; // a chain certificate without a key
        }
        const char *szStep = "";
        DWORD dwError = CertGiveKeyOwnContainer(pCertificate, &szStep);
        if (dwError != ERROR_SUCCESS)
        {
            CertFreeCertificateContext(pCertificate);
            SetLastError(dwError);
            return CertFailed(szStep);
        }
        if (!CertAddCertificateContextToStore(hMy.Get(), pCertificate,
                                              CERT_STORE_ADD_REPLACE_EXISTING, nullptr))
        {
            CertFreeCertificateContext(pCertificate);
            return CertFailed("CertAddCertificateContextToStore");
        }
        printf("imported %ls%s\n", CertSubject(pCertificate).c_str(),
               CertHasDeviceUsage(pCertificate) ? " (device certificate)" : "");
        cImported++;
    }
    if (!CertCommitAndClose(hMy))
    {
        return CertFailed("committing the MY store");
    }
    if (cImported == 0)
    {
        fprintf(stderr, "telvanectl: the PFX file holds no certificate with a key\n");
        return c_iCtlExitFailed;
    }
    return c_iCtlExitOk;
}

// Removes from the user's "MY" store every certificate that carries the device usage or
// that "import" put there, with the key containers "import" made.
int CertRemove(int argc, wchar_t **argv)
{
    if (argc != 0)
    {
        return CtlCommandUsage("platform cert remove takes no arguments");
    }
    CCertStoreHandle hMy(CertOpenSystem(CERT_SYSTEM_STORE_CURRENT_USER, L"MY"));
    if (!hMy)
    {
        return CertFailed("opening the current user's MY store");
    }
    std::vector<PCCERT_CONTEXT> rgDevice;
    PCCERT_CONTEXT pCertificate = nullptr;
    while ((pCertificate = CertEnumCertificatesInStore(hMy.Get(), pCertificate)) != nullptr)
    {
        std::vector<BYTE> rgbInfo;
        if (CertHasDeviceUsage(pCertificate) || CertHasOwnContainer(pCertificate, rgbInfo))
        {
            rgDevice.push_back(CertDuplicateCertificateContext(pCertificate));
        }
    }
    int iExit = c_iCtlExitOk;
    for (PCCERT_CONTEXT pDevice : rgDevice)
    {
        printf("removing %ls\n", CertSubject(pDevice).c_str());
        CertDeleteOwnContainer(pDevice);
        // The delete frees the context whatever it returns.
        if (!CertDeleteCertificateFromStore(pDevice))
        {
            iExit = CertFailed("CertDeleteCertificateFromStore");
        }
    }
    if (!CertCommitAndClose(hMy))
    {
        return CertFailed("committing the MY store");
    }
    return iExit;
}

int CertList(int argc, wchar_t **argv)
{
    CCertStoreHandle hMy(
        CertOpenSystem(CERT_SYSTEM_STORE_CURRENT_USER | CERT_STORE_READONLY_FLAG, L"MY"));
    if (!hMy)
    {
        return CertFailed("opening the current user's MY store");
    }
    PCCERT_CONTEXT pCertificate = nullptr;
    while ((pCertificate = CertEnumCertificatesInStore(hMy.Get(), pCertificate)) != nullptr)
    {
        printf("%ls%s\n", CertSubject(pCertificate).c_str(),
               CertHasDeviceUsage(pCertificate) ? " (device certificate)" : "");
    }
    return c_iCtlExitOk;
}

// "root add FILE" / "root remove FILE": the machine's trusted roots.
int CertRoot(int argc, wchar_t **argv)
{
    if (argc != 2 || (wcscmp(argv[0], L"add") != 0 && wcscmp(argv[0], L"remove") != 0))
    {
        return CtlCommandUsage("platform cert root takes add or remove and a certificate file");
    }
    CCertContextHandle hCertificate(CertLoadFile(argv[1]));
    if (!hCertificate)
    {
        return CertFailed("reading the certificate file");
    }
    CCertStoreHandle hRoot(CertOpenSystem(CERT_SYSTEM_STORE_LOCAL_MACHINE, L"Root"));
    if (!hRoot)
    {
        return CertFailed("opening the machine's Root store");
    }
    if (wcscmp(argv[0], L"add") == 0)
    {
        if (!CertAddCertificateContextToStore(hRoot.Get(), hCertificate.Get(),
                                              CERT_STORE_ADD_REPLACE_EXISTING, nullptr))
        {
            return CertFailed("CertAddCertificateContextToStore");
        }
    }
    else
    {
        PCCERT_CONTEXT pFound;
        while (
            (pFound = CertFindCertificateInStore(hRoot.Get(), c_dwEncoding, 0, CERT_FIND_EXISTING,
                                                 hCertificate.Get(), nullptr)) != nullptr)
        {
            if (!CertDeleteCertificateFromStore(pFound))
            {
                return CertFailed("CertDeleteCertificateFromStore");
            }
        }
    }
    if (!CertCommitAndClose(hRoot))
    {
        return CertFailed("committing the Root store");
    }
    return c_iCtlExitOk;
}

// "provision" shows the stand-in's answer and call count; "provision ok" or
// "provision fail HRESULT" sets the answer.
int CertProvision(int argc, wchar_t **argv)
{
    if (argc == 0)
    {
        DWORD dwResult = 0;
        DWORD dwCalls = 0;
        DWORD cb = sizeof(DWORD);
        RegGetValueW(HKEY_LOCAL_MACHINE, GOVCPC_STANDIN_KEY, L"Result", RRF_RT_REG_DWORD, nullptr,
                     &dwResult, &cb);
        cb = sizeof(DWORD);
        RegGetValueW(HKEY_LOCAL_MACHINE, GOVCPC_STANDIN_KEY, L"Calls", RRF_RT_REG_DWORD, nullptr,
                     &dwCalls, &cb);
        printf("result 0x%08lx, %lu calls\n", static_cast<unsigned long>(dwResult),
               static_cast<unsigned long>(dwCalls));
        return c_iCtlExitOk;
    }
    LSTATUS status;
    if (argc == 1 && wcscmp(argv[0], L"ok") == 0)
    {
        status = RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, GOVCPC_STANDIN_KEY, L"Result");
        if (status == ERROR_FILE_NOT_FOUND)
        {
            status = ERROR_SUCCESS;
        }
    }
    else if (argc == 2 && wcscmp(argv[0], L"fail") == 0)
    {
        wchar_t *pwchEnd = nullptr;
        unsigned long ulResult = wcstoul(argv[1], &pwchEnd, 0);
        if (pwchEnd == argv[1] || *pwchEnd != L'\0' || ulResult > 0xFFFFFFFFul)
        {
            return CtlCommandUsage("platform cert provision fail takes an HRESULT");
        }
        DWORD dwResult = static_cast<DWORD>(ulResult);
        status = RegSetKeyValueW(HKEY_LOCAL_MACHINE, GOVCPC_STANDIN_KEY, L"Result", REG_DWORD,
                                 &dwResult, sizeof(dwResult));
    }
    else
    {
        return CtlCommandUsage("platform cert provision takes ok or fail HRESULT");
    }
    if (status != ERROR_SUCCESS)
    {
        SetLastError(static_cast<DWORD>(status));
        return CertFailed("setting the provisioning stand-in");
    }
    return c_iCtlExitOk;
}

int CtlCert(int argc, wchar_t **argv)
{
    if (argc < 1)
    {
        return CtlCommandUsage("platform cert needs import, remove, list, root or provision");
    }
    std::wstring wstrVerb = argv[0];
    if (wstrVerb == L"import")
    {
        return CertImport(argc - 1, argv + 1);
    }
    if (wstrVerb == L"remove")
    {
        return CertRemove(argc - 1, argv + 1);
    }
    if (wstrVerb == L"list")
    {
        return CertList(argc - 1, argv + 1);
    }
    if (wstrVerb == L"root")
    {
        return CertRoot(argc - 1, argv + 1);
    }
    if (wstrVerb == L"provision")
    {
        return CertProvision(argc - 1, argv + 1);
    }
    return CtlCommandUsage("platform cert needs import, remove, list, root or provision");
}

const CtlCommand s_certCommand(
    L"platform cert", CtlCert,
    "       telvanectl platform cert import FILE.pfx [PASSWORD]\n"
    "           puts the certificates with keys of FILE.pfx into the user's MY store, each\n"
    "           key in a container of its own\n"
    "       telvanectl platform cert remove | list\n"
    "           removes every device or imported certificate from MY / lists MY\n"
    "       telvanectl platform cert root add|remove FILE\n"
    "           trusts or stops trusting a CA (DER or PEM) in the machine's Root store\n"
    "       telvanectl platform cert provision [ok | fail HRESULT]\n"
    "           shows or sets what the certificate provisioning stand-in answers\n");
} // namespace
