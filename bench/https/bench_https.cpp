// How long one HTTPS JSON request takes against the local policy service: a fresh TLS
// connection with the device certificate each time (the service closes every connection,
// as a policy refresh a day apart would find it), a policy answer read into a tree. Prints
// the spread over the rounds in milliseconds; never run as a test. Needs the certificates
// of the HTTPS tests in the prefix's stores: run it through run_bench_https.sh.
#include "lib/orvexjsonclient.h"
#include "servicelib/diagnostics.h"
#include "tests/common/policyserver.h"

#include <algorithm>
#include <stdio.h>
#include <vector>

namespace
{
const USHORT c_usPort = 47190;
const unsigned c_cRounds = 30;

void SilentLog(const wchar_t *) {}

double Milliseconds(const LARGE_INTEGER &start, const LARGE_INTEGER &end)
{
    LARGE_INTEGER frequency;
    QueryPerformanceFrequency(&frequency);
    return 1000.0 * static_cast<double>(end.QuadPart - start.QuadPart) /
           static_cast<double>(frequency.QuadPart);
}
} // namespace

int main()
{
    DiagnosticsSetLogHook(SilentLog);
    PolicyServerOptions options;
    options.usPort = c_usPort;
    options.cRequests = c_cRounds + 1;
    options.cLifetimeSeconds = 120;
    CTestPolicyServer server;
    if (!server.Start(options))
    {
        fprintf(stderr, "bench_https: the policy service did not start\n");
        return 1;
    }
    JsonRequest request;
    request.url = CTestPolicyServer::Url(c_usPort);
    request.verb = L"GET";
    request.userAgent = L"Telvane";
    request.skipConnectionRequirements = true;

    // The first request also loads the TLS and crypto libraries into the process.
    std::vector<double> rgms;
    for (unsigned i = 0; i <= c_cRounds; i++)
    {
        LARGE_INTEGER start;
        LARGE_INTEGER end;
        JsonValue *pRoot = nullptr;
        QueryPerformanceCounter(&start);
        HRESULT hr = OrvexJsonSendRequest(&request, &pRoot);
        QueryPerformanceCounter(&end);
        delete pRoot;
        if (FAILED(hr))
        {
            fprintf(stderr, "bench_https: request %u failed: 0x%08lx\n", i,
                    static_cast<unsigned long>(hr));
            return 1;
        }
        if (i == 0)
        {
            printf("first request (libraries loading): %.1f ms\n", Milliseconds(start, end));
            continue;
        }
        rgms.push_back(Milliseconds(start, end));
    }
    std::sort(rgms.begin(), rgms.end());
    printf("one policy request, new TLS connection with client certificate, %u rounds:\n",
           c_cRounds);
    printf("  min %.1f ms  median %.1f ms  p90 %.1f ms  max %.1f ms\n", rgms.front(),
           rgms[rgms.size() / 2], rgms[rgms.size() * 9 / 10], rgms.back());
    return 0;
}
