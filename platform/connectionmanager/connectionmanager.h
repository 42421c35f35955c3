// Stand-in for the phone's connection manager library: the four calls a network client
// makes to state what connection its session needs. It records every call, in order, in a
// registry value another process can read, and fails as its registry key says. Any thread
// may call it.
#pragma once

#include <windows.h>

// HKEY_LOCAL_MACHINE key of the stand-in.
//   "Calls" (REG_MULTI_SZ): one string per call, oldest first, e.g.
//       "CmApiInit", "CmSetRequirements 0x00001234 2 1 3 2 0", "CmCloseSession 0x00001234",
//       "CmApiDeinit".
//   "FailInit" (REG_DWORD, optional): non-zero makes CmApiInit return FALSE.
//   "RequirementsResult" (REG_DWORD, optional): what CmSetRequirements returns (0 when absent).
#define CM_STANDIN_KEY L"Software\\Telvane\\StandIns\\ConnectionManager"

// The session a network request belongs to, as the platform HTTP client reports it.
typedef DWORD CM_SESSION;

#ifdef __cplusplus
extern "C"
{
#endif

    BOOL WINAPI CmApiInit(void);

    // pdwRequirements points at cbRequirements bytes of 32-bit requirement values. Returns 0
    // when the requirements were accepted.
    DWORD WINAPI CmSetRequirements(CM_SESSION session, const DWORD *pdwRequirements,
                                   DWORD cbRequirements);

    void WINAPI CmCloseSession(CM_SESSION session);

    void WINAPI CmApiDeinit(void);

#ifdef __cplusplus
}
#endif
