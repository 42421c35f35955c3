// Stand-in for the phone's security runtime library: what the service asks of it, and no
// more. The functions may be called from any thread.
#pragma once

#include <windows.h>

// HKEY_LOCAL_MACHINE key of the chamber state: "FailCall" (REG_SZ: "GetChamberSidFromId" or
// "CreateProcessInChamber") and "FailCode" (REG_DWORD) make that call fail; every process
// started records "LastChamberSid", "LastChamberInstance", "LastCommandLine" (REG_SZ) and
// "LastProcessId" (REG_DWORD) there and counts itself in "LaunchCount" (REG_DWORD).
#define CHAMBER_STANDIN_KEY L"Software\\Telvane\\StandIns\\Chambers"

// What a failing chamber call returns unless told otherwise: access denied.
#define CHAMBER_STANDIN_FAILURE ((HRESULT)0x80070005)

// Object-type code of a named pipe the service creates.
#define TRANSIENT_OBJECT_TYPE_NAMED_PIPE 6

#ifdef __cplusplus
extern "C"
{
#endif

    // A security descriptor for a transient object of the given type and name; on success the
    // caller owns *ppSecurityDescriptor and frees it with FreeTransientObjectSecurityDescriptor.
    // Returns 0 or a failure HRESULT (then *ppSecurityDescriptor is null).
    HRESULT WINAPI QueryTransientObjectSecurityDescriptor(
        DWORD dwObjectType, PCWSTR pwszObjectName, PSECURITY_DESCRIPTOR *ppSecurityDescriptor);

    void WINAPI FreeTransientObjectSecurityDescriptor(PSECURITY_DESCRIPTOR pSecurityDescriptor);

    // The security identifier of the chamber with this name (a capability SID of authority
    // 15, the same for the same name in any letter case). The caller frees *ppSid with
    // LocalFree. An empty name gives E_INVALIDARG; on failure *ppSid is null.
    HRESULT WINAPI GetChamberSidFromId(PCWSTR pwszChamberId, PSID *ppSid);

    // Starts a process inside the chamber: as CreateProcessW with the given application name,
    // writable command line, inheritance, creation flags and environment, the current
    // directory and security of the caller. The startup block may be shorter than this
    // platform's (the phone's is 68 bytes); its cb field says how long it is. On success the
    // caller owns both handles in *pProcessInformation.
    HRESULT WINAPI CreateProcessInChamber(PSID pChamberSid, PCWSTR pwszChamberInstance,
                                          PCWSTR pwszApplicationName, PWSTR pwszCommandLine,
                                          BOOL fInheritHandles, DWORD dwCreationFlags,
                                          PVOID pvEnvironment, LPSTARTUPINFOW pStartupInfo,
                                          LPPROCESS_INFORMATION pProcessInformation);

    // Test control: make one of the two chamber calls fail with hr (null call: none fails).
    HRESULT WINAPI ChamberStandInSetFailure(PCWSTR pwszCall, HRESULT hr);

#ifdef __cplusplus
}
#endif
