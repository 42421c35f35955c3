#include "lib/devicecertificate.h"
#include "inc/lasterror.h"
#include "inc/handleholder.h"
#include "lib/orvexjsontrace.h"
#include "platform/certprovisioning/certprovisioning.h"

#include <string.h>
#include <vector>

namespace
{
// The same test as the platform's usage search with no find flags: a certificate matches
// when its usage extension or property lists the identifier, or when it carries neither
// and is therefore good for every usage.
bool DeviceCertificateHasUsage(PCCERT_CONTEXT pCertificate, const char *szUsage)
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
    if (pUsage->cUsageIdentifier == 0)
    {
        return GetLastError() == static_cast<DWORD>(CRYPT_E_NOT_FOUND);
    }
    for (DWORD i = 0; i < pUsage->cUsageIdentifier; i++)
    {
        if (strcmp(pUsage->rgpszUsageIdentifier[i], szUsage) == 0)
        {
            return true;
        }
    }
    return false;
}

// Wine does not implement the usage search (it answers "not found" for every store), so
// a store that the search finds nothing in is walked once more with the same test.
PCCERT_CONTEXT DeviceCertificateEnumerate(HCERTSTORE hStore, const char *szUsage)
{
    PCCERT_CONTEXT pCertificate = nullptr;
    while ((pCertificate = CertEnumCertificatesInStore(hStore, pCertificate)) != nullptr)
    {
        if (DeviceCertificateHasUsage(pCertificate, szUsage))
        {
            return pCertificate;
        }
    }
    SetLastError(static_cast<DWORD>(CRYPT_E_NOT_FOUND));
    return nullptr;
}
} // namespace

HRESULT DeviceCertificateFind(PCCERT_CONTEXT *ppCertificate)
{
    *ppCertificate = nullptr;
    HRESULT hr = GOVCPC_ProvisionGOVCertificate();
    if (FAILED(hr) && hr != GOVCPC_S_ALREADY_PROVISIONED)
    {
        OrvexJsonTraceCode(OrvexJsonEvent_Provision, static_cast<ULONG>(hr));
        return hr;
    }

    CCertStoreHandle hStore(
        CertOpenStore(CERT_STORE_PROV_SYSTEM_W, X509_ASN_ENCODING | PKCS_7_ASN_ENCODING, 0,
                      CERT_SYSTEM_STORE_CURRENT_USER | CERT_STORE_READONLY_FLAG, L"MY"));
    if (!hStore)
    {
        hr = HResultFromLastError();
        OrvexJsonTraceCode(OrvexJsonEvent_OpenStore, static_cast<ULONG>(hr));
        return hr;
    }

    char szUsage[] = GOVCPC_DEVICE_CERTIFICATE_USAGE;
    LPSTR rgszUsage[] = {szUsage};
    CERT_ENHKEY_USAGE usage = {1, rgszUsage};
    PCCERT_CONTEXT pCertificate =
        CertFindCertificateInStore(hStore.Get(), X509_ASN_ENCODING | PKCS_7_ASN_ENCODING, 0,
                                   CERT_FIND_ENHKEY_USAGE, &usage, nullptr);
    if (pCertificate == nullptr)
    {
        pCertificate = DeviceCertificateEnumerate(hStore.Get(), szUsage);
    }
    if (pCertificate == nullptr)
    {
        hr = HResultFromLastError();
        OrvexJsonTraceCode(OrvexJsonEvent_NoCertificate, static_cast<ULONG>(hr));
        return hr;
    }
    *ppCertificate = pCertificate;
    return S_OK;
}
