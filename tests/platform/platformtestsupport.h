// State names for the platform stand-ins' tests, on top of the common harness: each test
// makes states of its own, so that runs side by side never meet.
#pragma once

#include "platform/statenotify/statenotify.h"
#include "tests/common/testsupport.h"

#include <string.h>
#include <string>

namespace platformtest
{
inline WNF_STATE_NAME NewStateName()
{
    GUID guid = testsupport::NewGuid();
    WNF_STATE_NAME stateName = 0;
    memcpy(&stateName, &guid, sizeof(stateName));
    return stateName;
}

// "0x" and sixteen hex digits, as telvanectl takes a state name.
inline std::wstring StateNameText(WNF_STATE_NAME stateName)
{
    wchar_t wsz[24];
    swprintf(wsz, ARRAYSIZE(wsz), L"0x%016llx", static_cast<unsigned long long>(stateName));
    return wsz;
}
} // namespace platformtest
