#include "service/telvaneservice.h"
#include "service/resource.h"
#include "servicelib/eventtrace.h"

TelvaneService g_TelvaneService;

TelvaneService::TelvaneService()
{
    m_wszServiceName = L"Telvane";
    m_idsLocalizedName = IDS_TELVANE_DISPLAY_NAME;
    m_idsDescription = IDS_TELVANE_DESCRIPTION;
    m_ulStartType = SERVICE_AUTO_START;
}

TelvaneService::~TelvaneService() {}

void TelvaneService::OnStart()
{
    TelvaneTrace("TelvaneService::OnStart()");
    SetStatus(SERVICE_RUNNING);
}

void TelvaneService::OnStop()
{
    TelvaneTrace("TelvaneService::OnStop()");
    SetStatus(SERVICE_STOPPED);
}
