// The UDP echo test's steps that reach the platform: the Wi-Fi gate, and starting the test
// application in its chamber. Free functions for the launcher's handlers; they run on the
// launcher's queue, one at a time, and touch only the record they are given.
#pragma once

#include "service/udptestconfig.h"

#include <windows.h>

const wchar_t c_wszUdpTestApplication[] = L"C:\\programs\\zoriviroruz\\ZoRiVirOruz.exe";
const wchar_t c_wszUdpTestChamberId[] = L"ZoRiVirOruz";
const wchar_t c_wszUdpTestChamberInstance[] = L"{5B04B775-356B-4AA0-AAF8-6491FFEA562E}";
// The application's whole command line, path included, in wide characters.
const size_t c_cchUdpTestCommandLine = 256;

// True when the Wi-Fi adapter is connected; then the record's localIp holds the adapter's
// address. A failing call of the wireless library is traced with its result, and a refusal
// with "We dont have active WiFi".
bool UdpTestWiFiActive(UdpTestConfig *pConfig);

// Starts the test application in its chamber with the record's arguments, stamps lastTest
// and saves the record. *phProcess receives the started process, or INVALID_HANDLE_VALUE when
// none started. A process that started is handed out even when saving the record failed
// afterwards (the result is then the save's failure): the caller must track it, or a second
// test could run beside it. A command line that does not fit is refused (0x8007007A), since
// a cut one could send the test to a wrong port.
HRESULT LaunchUdpTest(UdpTestConfig *pConfig, HANDLE *phProcess);
