#include "platform/securityruntime/securityruntime.h"

#include <sddl.h>

namespace
{
// Every local process may read and write the pipe and set its read mode (0x12018b: generic
// read, write data, write attributes); the system and administrators have full control;
// network logons are refused outright (the pipes also reject remote clients). Generic write
// would include the append right, which on a pipe is the right to create an instance of it:
// any process could then serve the pipe's name to the service's clients.
const wchar_t c_wszPipeDescriptor[] = L"D:(D;;GA;;;NU)(A;;GA;;;SY)(A;;GA;;;BA)(A;;0x12018b;;;WD)";
} // namespace

extern "C" HRESULT WINAPI QueryTransientObjectSecurityDescriptor(
    DWORD dwObjectType, PCWSTR pwszObjectName, PSECURITY_DESCRIPTOR *ppSecurityDescriptor)
{
    if (ppSecurityDescriptor == nullptr)
    {
        return E_POINTER;
    }
    *ppSecurityDescriptor = nullptr;
    if (dwObjectType != TRANSIENT_OBJECT_TYPE_NAMED_PIPE || pwszObjectName == nullptr)
    {
        return E_INVALIDARG;
    }
    if (!ConvertStringSecurityDescriptorToSecurityDescriptorW(c_wszPipeDescriptor, SDDL_REVISION_1,
                                                              ppSecurityDescriptor, nullptr))
    {
        *ppSecurityDescriptor = nullptr;
        return HRESULT_FROM_WIN32(GetLastError());
    }
    return S_OK;
}

extern "C" void WINAPI
FreeTransientObjectSecurityDescriptor(PSECURITY_DESCRIPTOR pSecurityDescriptor)
{
    if (pSecurityDescriptor != nullptr)
    {
        LocalFree(pSecurityDescriptor);
    }
}
