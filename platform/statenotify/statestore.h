// Where the state-notification stand-in keeps its machine-wide state values: one volatile
// registry key per state name under HKLM\SOFTWARE\Telvane\Platform\StateNotification (it
// lasts until the machine, or the Wine prefix's server, restarts), whose binary value "Data"
// holds the change stamp (4 bytes, little-endian) followed by the state's data. One value
// write is atomic, so readers never see a stamp with another publication's data; writers
// take a machine-wide mutex per state name so that stamps rise by exactly one. A change of
// the value is what subscribers wait for (RegNotifyChangeKeyValue). The functions may be
// called from any thread and return Win32 error codes.
#pragma once

#include "platform/statenotify/statenotify.h"

#include <windows.h>

// Opens the state's key, creating it (and its parents) when fCreate; without fCreate a
// state never published answers ERROR_FILE_NOT_FOUND.
LONG StateStoreOpenKey(WNF_STATE_NAME stateName, REGSAM samDesired, bool fCreate, HKEY *phKey);

// Reads the state's value from its key. A state without a value reads as stamp 0 and no data;
// a value that is not what a publisher writes answers ERROR_INVALID_DATA. pbData has room for
// WNF_STATE_MAX_DATA_SIZE bytes.
LONG StateStoreRead(HKEY hKey, WNF_CHANGE_STAMP *pStamp, BYTE *pbData, ULONG *pcbData);

// Writes a new value with the next change stamp (never 0), under the state's mutex.
LONG StateStoreWrite(WNF_STATE_NAME stateName, const void *pvData, ULONG cbData,
                     WNF_CHANGE_STAMP *pStamp);

// An NTSTATUS carrying a Win32 error code, as the facility reports failures of the calls
// beneath it.
NTSTATUS StateStoreStatusFromError(LONG lError);
