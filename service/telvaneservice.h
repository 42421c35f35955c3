// The coordinator of the Telvane service. It runs the service lifecycle under the shell:
// started, it reports RUNNING; stopped, it reports STOPPED.
#pragma once

#include "servicelib/service.h"

// The service host group the service is installed in.
const wchar_t c_wszTelvaneGroup[] = L"OVTCBNetwork";

// The one coordinator: a static object built when the DLL loads and destroyed when it
// unloads. The shell runs OnStart on a thread-pool thread (or the console thread) and
// OnStop on the host's stop-callback thread, the dispatcher thread or the console thread.
class TelvaneService : public CService
{
public:
    TelvaneService();
    ~TelvaneService() override;

    void OnStart() override;
    void OnStop() override;
};

extern TelvaneService g_TelvaneService;
