// Stand-in for the phone's security runtime library: what the service asks of it, and no
// more. The functions may be called from any thread.
#pragma once

#include <windows.h>

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

#ifdef __cplusplus
}
#endif
