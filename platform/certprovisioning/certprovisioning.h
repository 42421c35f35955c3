// Stand-in for the phone's certificate provisioning library. On the phone the call makes
// sure the device certificate is enrolled in the current user's "MY" store; here it only
// answers what its registry key says (success by default, whatever the store holds), so
// that a missing certificate reaches the caller's own store lookup. Any thread may call it.
#pragma once

#include <windows.h>

// Enhanced key usage that marks the device certificate among the user's certificates.
#define GOVCPC_DEVICE_CERTIFICATE_USAGE "1.3.6.1.4.1.59871.20.1.1"

// The "already provisioned" answer; callers count it as success.
#define GOVCPC_S_ALREADY_PROVISIONED ((HRESULT)0x81120002L)

// HKEY_LOCAL_MACHINE key of the stand-in. "Result" (REG_DWORD, optional): the HRESULT
// every call returns (S_OK when absent). "Calls" (REG_DWORD): how many calls were made.
#define GOVCPC_STANDIN_KEY L"Software\\Telvane\\StandIns\\CertProvisioning"

#ifdef __cplusplus
extern "C"
{
#endif

    HRESULT WINAPI GOVCPC_ProvisionGOVCertificate(void);

#ifdef __cplusplus
}
#endif
