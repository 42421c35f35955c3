// The policy's refresh from the web service, over the HTTPS JSON client.
#include "service/udptestpolicy.h"

#include "lib/orvexjsonclient.h"
#include "platform/endpointdirectory/endpointdirectory.h"
#include "servicelib/eventtrace.h"

void RefreshUdpConfig(UdpTestConfig *pConfig)
{
    TelvaneTraceMark(TelvaneEvent_UdpConfigRefresh);
    bool fFailed = true;
    PWSTR pwszEndpoint = nullptr;
    JsonValue *pResponse = nullptr;
    HRESULT hr = GetServiceEndpoint(c_wszUdpConfigRole, &pwszEndpoint, 0);
    if (FAILED(hr))
    {
        TelvaneTraceUdpFailure("GetServiceEndpoint", static_cast<ULONG>(hr));
    }
    else
    {
        JsonRequest request;
        request.url = pwszEndpoint != nullptr ? pwszEndpoint : L"";
        request.url += c_wszUdpConfigPath;
        request.verb = L"GET";
        request.userAgent = L"Telvane";
        request.skipConnectionRequirements = true;
        request.gzip = false;
        request.ignoreCertErrors = false;
        hr = OrvexJsonSendRequest(&request, &pResponse);
        if (FAILED(hr))
        {
            TelvaneTraceUdpFailure("OrvexJsonSendRequest", static_cast<ULONG>(hr));
        }
        else
        {
            hr = pResponse->Type() == JsonNodeType::Object
                     ? ApplyUdpConfig(pConfig, static_cast<const JsonObjectNode *>(pResponse))
                     : E_UNEXPECTED;
            if (FAILED(hr))
            {
                TelvaneTraceUdpFailure("ParseJson", static_cast<ULONG>(hr));
            }
            else
            {
                fFailed = false;
            }
        }
    }
    ReleaseEndpoint(pwszEndpoint);
    delete pResponse;
    if (fFailed)
    {
        pConfig->expiration = UdpConfigNow() + c_ullUdpConfigRetryTicks;
    }
    SaveUdpConfig(pConfig);
}
