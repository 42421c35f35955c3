// String resources of telvane.dll. The control manager shows them as the service's display
// name and description, read from the DLL through "@path,-id" references.
#pragma once

#define IDS_TELVANE_DISPLAY_NAME 101
#define IDS_TELVANE_DESCRIPTION 102
