// The HTTPS JSON client against the local TLS policy service, with the device certificate
// from the prefix's real "MY" store and the test CA in its real "Root" store (set up by the
// suite's CTest fixture). Each server has a port of its own: WinHTTP may hand a later
// request a connection an earlier one left open.
#include "lib/jsonrequestcontext.h"
#include "lib/orvexjsonclient.h"
#include "lib/orvexjsontrace.h"
#include "platform/certprovisioning/certprovisioning.h"
#include "platform/connectionmanager/connectionmanager.h"
#include "tests/common/policyserver.h"
#include "tests/common/testsupport.h"
#include "tests/common/tracesession.h"

#include <winsock2.h>

#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <vector>

namespace
{
// The client's own results, spelled out: a wrong constant in the client must fail here.
const HRESULT c_hrNotFound = static_cast<HRESULT>(0x80092004); // CRYPT_E_NOT_FOUND
const HRESULT c_hrStatus = static_cast<HRESULT>(0x80070490);
const HRESULT c_hrEmpty = static_cast<HRESULT>(0x800700E8);
const HRESULT c_hrNotObject = static_cast<HRESULT>(0x8007000D);
const HRESULT c_hrTooLarge = static_cast<HRESULT>(0x800710F0);
const HRESULT c_hrAccessDenied = static_cast<HRESULT>(0x80070005);
// Under Wine every TLS failure arrives as this request error; no secure failure comes.
const ULONG c_ulSecureChannelError = 12157;
const DWORD c_dwCmSession = 0x1234;

BOOL QueryCmSessionHook(HINTERNET, DWORD *pdwSession)
{
    *pdwSession = c_dwCmSession;
    return TRUE;
}

std::vector<std::string> RecordedCmCalls()
{
    std::vector<std::string> rgCalls;
    DWORD dwType = 0;
    std::wstring wstrCalls;
    if (testsupport::HklmReadRaw(CM_STANDIN_KEY, L"Calls", &dwType, &wstrCalls))
    {
        for (const wchar_t *p = wstrCalls.c_str(); *p != L'\0'; p += wcslen(p) + 1)
        {
            rgCalls.push_back(testsupport::Narrow(p));
        }
    }
    return rgCalls;
}

void ResetStandIns()
{
    OrvexJsonSetCmSessionQueryHook(nullptr);
    testsupport::HklmDeleteValue(CM_STANDIN_KEY, L"FailInit");
    testsupport::HklmDeleteValue(CM_STANDIN_KEY, L"RequirementsResult");
    testsupport::HklmDeleteValue(GOVCPC_STANDIN_KEY, L"Result");
}

// A server for this many requests. One that will serve none (its clients fail first) lives
// only briefly, so that a next run soon after finds its port free.
PolicyServerOptions ServerOn(USHORT usPort, unsigned cRequests = 1)
{
    PolicyServerOptions options;
    options.usPort = usPort;
    options.cRequests = cRequests > 0 ? cRequests : 1;
    options.cLifetimeSeconds = cRequests > 0 ? 30 : 10;
    return options;
}

// Runs on the test's main thread; the client's events arrive from WinHTTP's threads in the
// fixture's trace session, which lives as long as the test.
class HttpsClientTest : public ::testing::Test
{
protected:
    void TearDown() override { ResetStandIns(); }

    static JsonRequest Request(const std::wstring &wstrUrl)
    {
        JsonRequest request;
        request.url = wstrUrl;
        request.verb = L"GET";
        request.userAgent = L"Telvane";
        request.skipConnectionRequirements = true;
        return request;
    }

    static HRESULT Send(const JsonRequest &request, std::unique_ptr<JsonValue> *pRoot = nullptr)
    {
        JsonValue *pValue = nullptr;
        HRESULT hr = OrvexJsonSendRequest(&request, &pValue);
        std::unique_ptr<JsonValue> root(pValue);
        if (pRoot != nullptr)
        {
            pRoot->swap(root);
        }
        return hr;
    }

    std::vector<USHORT> Ids() const
    {
        std::vector<USHORT> rgIds;
        for (const testsupport::TracedEvent &event : m_session.Events())
        {
            rgIds.push_back(event.usId);
        }
        return rgIds;
    }

    // Whether the event was written; its payload's first field as a 32-bit code, if any.
    bool Find(USHORT usId, ULONG *pulCode = nullptr, std::string *pstrField = nullptr) const
    {
        for (const testsupport::TracedEvent &event : m_session.Events())
        {
            if (event.usId != usId)
            {
                continue;
            }
            std::string strField = event.rgFields.empty() ? std::string() : event.rgFields[0];
            if (pulCode != nullptr && strField.size() == sizeof(ULONG))
            {
                memcpy(pulCode, strField.data(), sizeof(ULONG));
            }
            if (pstrField != nullptr)
            {
                *pstrField = strField;
            }
            return true;
        }
        return false;
    }

    static std::string MemberText(const JsonValue *pRoot, const char *szName)
    {
        std::string strText;
        if (pRoot != nullptr && pRoot->Type() == JsonNodeType::Object)
        {
            static_cast<const JsonObjectNode *>(pRoot)->GetMemberText(szName, strText);
        }
        return strText;
    }

    testsupport::CTraceSession m_session{&g_OrvexJsonTraceProvider, ORVEXJSON_PROVIDER_GUID};
};

// Answers of the service: the outcome, the event that says why (with its code when it has
// one) and, for an object, one member's text.
TEST_F(HttpsClientTest, CompletesWithTheAnswersOutcome)
{
    struct Case
    {
        const char *szName;
        USHORT usPort;
        int iStatus;
        const char *szBody; // null: the server's default policy
        unsigned cChunks;
        size_t cbPadTo;
        HRESULT hrExpected;
        USHORT usEvent;
        ULONG ulEventCode;     // checked when non-zero
        const char *szEnabled; // "Enabled" of the object, when one is expected
    };
    const Case rgCases[] = {
        {"Policy200", 47101, 200, nullptr, 0, 0, S_OK, 26, 0, "true"},
        {"NotFound404", 47102, 404, "{\"Enabled\":\"true\"}", 0, 0, c_hrStatus, 19, 404, nullptr},
        {"EmptyBody", 47103, 200, "", 0, 0, c_hrEmpty, 23, 0, nullptr},
        {"ArrayRoot", 47104, 200, "[1,2]", 0, 0, c_hrNotObject, 25, 0, nullptr},
        {"ScalarRoot", 47107, 200, "\"text\"", 0, 0, c_hrNotObject, 25, 0, nullptr},
        {"ServerError500", 47112, 500, "{}", 0, 0, c_hrStatus, 19, 500, nullptr},
        // Pieces that each carry distinct text: a lost, doubled or reordered piece changes the
        // body that event 99 carries.
        {"Chunked", 47108, 200,
         "{\"Enabled\":\"TRUE\",\"RelayFQDN\":\"relay.example\",\"RelayPort\":47150,"
         "\"NumPackets\":10,\"DurationValid\":\"P1D\"}",
         9, 0, S_OK, 26, 0, "TRUE"},
        {"BodyAtLimit", 47109, 200, nullptr, 0, c_cbOrvexJsonMaxBody, S_OK, 26, 0, "true"},
        {"BodyPastLimit", 47110, 200, nullptr, 0, c_cbOrvexJsonMaxBody + 1, c_hrTooLarge, 28, 0,
         nullptr},
        {"ChunkedPastLimit", 47111, 200, nullptr, 8, 3 * c_cbOrvexJsonMaxBody, c_hrTooLarge, 28, 0,
         nullptr},
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        PolicyServerOptions options = ServerOn(c.usPort);
        options.iStatus = c.iStatus;
        options.fUseBody = c.szBody != nullptr;
        options.strBody = c.szBody != nullptr ? c.szBody : "";
        options.cChunks = c.cChunks;
        options.cbPadTo = c.cbPadTo;
        CTestPolicyServer server;
        ASSERT_TRUE(server.Start(options));
        m_session.Clear();

        // An http URL still goes over TLS; the service sees the device certificate (the other
        // imported client certificate has no device usage and must not be chosen), the path,
        // and the caller's extra headers after the content type.
        JsonRequest request = Request(CTestPolicyServer::Url(c.usPort, "http"));
        request.extraHeaders = L"X-Telvane-Test: seen";
        std::unique_ptr<JsonValue> pRoot;
        EXPECT_EQ(c.hrExpected, Send(request, &pRoot));
        std::vector<std::string> rgSeen = server.Requests();
        EXPECT_EQ(1u, rgSeen.size());
        for (const char *szPart : {"\"client\": \"Telvane Test Device\"",
                                   "\"path\": \"/v1/api/config/udpecho\"", "\"method\": \"GET\"",
                                   "\"contentType\": \"application/json\"", "\"extra\": \"seen\""})
        {
            EXPECT_NE(std::string::npos,
                      rgSeen.empty() ? std::string::npos : rgSeen[0].find(szPart))
                << szPart;
        }
        ULONG ulCode = 0;
        EXPECT_TRUE(Find(c.usEvent, &ulCode));
        if (c.ulEventCode != 0)
        {
            EXPECT_EQ(c.ulEventCode, ulCode);
        }
        std::string strBody;
        if (c.iStatus == 200 && c.szBody != nullptr && c.szBody[0] != '\0')
        {
            ASSERT_TRUE(Find(99, nullptr, &strBody));
            EXPECT_EQ(std::string(c.szBody) + '\0', strBody);
        }
        EXPECT_EQ(c.szEnabled != nullptr, pRoot != nullptr);
        if (c.szEnabled != nullptr)
        {
            EXPECT_EQ(c.szEnabled, MemberText(pRoot.get(), "Enabled"));
        }
        EXPECT_EQ(c.szEnabled == nullptr, Find(27)); // the failure path ran, or not
        EXPECT_TRUE(Find(12));                       // sent
        EXPECT_TRUE(Find(15));                       // closed
    }
}

// The security flags waive a bad name or date, never an unknown issuer; with nothing
// listening the request error comes back.
TEST_F(HttpsClientTest, TlsAndConnectionFailures)
{
    struct Case
    {
        const char *szName;
        USHORT usPort;
        const char *szHost;
        bool fServer;
        bool fRogue;
        bool fIgnore;
        ULONG ulError; // 0: succeeds; else the request error (event 22) and its HRESULT
    };
    const Case rgCases[] = {
        {"NameMismatchFails", 47139, "127.0.0.1", true, false, false, c_ulSecureChannelError},
        {"NameMismatchIgnored", 47140, "127.0.0.1", true, false, true, 0},
        {"UntrustedNotIgnored", 47141, "localhost", true, true, true, c_ulSecureChannelError},
        {"NothingListening", 47117, "localhost", false, false, false, ERROR_WINHTTP_CANNOT_CONNECT},
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        PolicyServerOptions options = ServerOn(c.usPort, c.ulError == 0 ? 1 : 0);
        options.fRogueCertificate = c.fRogue;
        CTestPolicyServer server;
        ASSERT_TRUE(!c.fServer || server.Start(options));
        m_session.Clear();

        std::string strUrl = std::string("https://") + c.szHost + ":" + std::to_string(c.usPort) +
                             "/v1/api/config/udpecho";
        JsonRequest request = Request(testsupport::Widen(strUrl));
        request.ignoreCertErrors = c.fIgnore;
        std::unique_ptr<JsonValue> pRoot;
        HRESULT hr = Send(request, &pRoot);
        EXPECT_FALSE(Find(10)); // the flags were taken
        EXPECT_EQ(c.ulError == 0, pRoot != nullptr);
        ULONG ulCode = 0;
        if (c.ulError != 0)
        {
            EXPECT_EQ(HRESULT_FROM_WIN32(c.ulError), hr);
            ASSERT_TRUE(Find(22, &ulCode));
            EXPECT_EQ(c.ulError, ulCode);
        }
        if (c.fServer)
        {
            EXPECT_EQ(c.ulError == 0 ? 1u : 0u, server.Requests().size());
        }
    }
}

// Without a device certificate the request is never sent: the lookup's own error comes
// back, and the close protocol still ends (the request handle's closing notification must
// find the context although no send gave it one).
TEST_F(HttpsClientTest, NoDeviceCertificateIsNotSent)
{
    CTestPolicyServer server;
    ASSERT_TRUE(server.Start(ServerOn(47118, 0)));
    testsupport::ChildResult removed = testsupport::RunTelvanectl(L"platform cert remove");
    ASSERT_EQ(0u, removed.dwExitCode) << removed.strOutput;

    HRESULT hr = Send(Request(CTestPolicyServer::Url(47118)));

    for (const char *szFile : {"device.pfx", "other.pfx"})
    {
        std::wstring wstrPfx = CTestPolicyServer::WindowsPath(CTestPolicyServer::PkiPath(szFile));
        testsupport::ChildResult restored =
            testsupport::RunTelvanectl(L"platform cert import " + wstrPfx + L" telvane");
        EXPECT_EQ(0u, restored.dwExitCode) << restored.strOutput;
    }
    EXPECT_EQ(c_hrNotFound, hr);
    ULONG ulCode = 0;
    ASSERT_TRUE(Find(32, &ulCode));
    EXPECT_EQ(static_cast<ULONG>(c_hrNotFound), ulCode);
    EXPECT_FALSE(Find(12)); // never sent
    EXPECT_TRUE(Find(15));  // closed through the protocol
    EXPECT_TRUE(server.Requests().empty());
}

// Failures before anything is sent, each with its event and code.
TEST_F(HttpsClientTest, EarlyFailuresReturnTheFailingCallsCode)
{
    struct Case
    {
        const char *szName;
        const wchar_t *wszUrl;
        bool fGzip;
        bool fConnectionRequirements;
        HRESULT hrExpected;
        USHORT usEvent;
    };
    const Case rgCases[] = {
        {"UnknownScheme", L"ftp://localhost:47127/v1/api/config/udpecho", false, false,
         HRESULT_FROM_WIN32(ERROR_WINHTTP_UNRECOGNIZED_SCHEME), 1},
        // Wine does not implement decompression (option 118, 12009) on the session, where the
        // client sets it; a connection handle refuses it outright (12018).
        {"GzipUnderWine", L"https://localhost:47128/v1/api/config/udpecho", true, false,
         HRESULT_FROM_WIN32(ERROR_WINHTTP_INVALID_OPTION), 3},
        // Nor can it give the connection-manager session (option 117): pinned, so that the
        // day it can, the query hook can go.
        {"CmSessionUnderWine", L"https://localhost:47122/v1/api/config/udpecho", false, true,
         E_INVALIDARG, 5},
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        m_session.Clear();
        JsonRequest request = Request(c.wszUrl);
        request.gzip = c.fGzip;
        request.skipConnectionRequirements = !c.fConnectionRequirements;
        EXPECT_EQ(c.hrExpected, Send(request));
        ULONG ulCode = 0;
        ASSERT_TRUE(Find(c.usEvent, &ulCode));
        EXPECT_EQ(static_cast<ULONG>(c.hrExpected), ulCode);
        EXPECT_FALSE(Find(12));
    }
}

// The connection manager is called in order and its result taken; the provisioning result
// decides too, where "already provisioned" counts as success.
TEST_F(HttpsClientTest, ConnectionManagerAndProvisioningDecide)
{
    struct Case
    {
        const char *szName;
        bool fSkip;
        bool fFailInit;
        DWORD dwRequirementsResult;
        DWORD dwProvisioning;
        HRESULT hrExpected;
        USHORT usEvent;    // 0: none expected
        ULONG ulEventCode; // checked when non-zero
        std::vector<std::string> rgCalls;
    };
    const std::vector<std::string> rgAllCalls = {"CmApiInit",
                                                 "CmSetRequirements 0x00001234 2 1 3 2 0",
                                                 "CmCloseSession 0x00001234", "CmApiDeinit"};
    const Case rgCases[] = {
        {"RequirementsAccepted", false, false, 0, 0, S_OK, 0, 0, rgAllCalls},
        {"InitFails", false, true, 0, 0, E_FAIL, 6, 0, {"CmApiInit"}},
        {"RequirementsRefused", false, false, 5, 0, E_FAIL, 7, 5, rgAllCalls},
        {"Skipped", true, false, 0, 0, S_OK, 0, 0, {}},
        {"AlreadyProvisioned", true, false, 0, 0x81120002, S_OK, 0, 0, {}},
        {"ProvisioningFails", true, false, 0, 0x80070005, c_hrAccessDenied, 30, 0x80070005, {}},
        {"OtherProvisioningFailure",
         true,
         false,
         0,
         0x81120003,
         static_cast<HRESULT>(0x81120003),
         30,
         0x81120003,
         {}},
    };
    CTestPolicyServer server;
    ASSERT_TRUE(server.Start(ServerOn(47123, 3)));
    size_t cRequests = 0;
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        ResetStandIns();
        OrvexJsonSetCmSessionQueryHook(QueryCmSessionHook);
        testsupport::HklmDeleteValue(CM_STANDIN_KEY, L"Calls");
        if (c.fFailInit)
        {
            testsupport::HklmSetDword(CM_STANDIN_KEY, L"FailInit", 1);
        }
        if (c.dwRequirementsResult != 0)
        {
            testsupport::HklmSetDword(CM_STANDIN_KEY, L"RequirementsResult",
                                      c.dwRequirementsResult);
        }
        if (c.dwProvisioning != 0)
        {
            testsupport::HklmSetDword(GOVCPC_STANDIN_KEY, L"Result", c.dwProvisioning);
        }
        m_session.Clear();

        JsonRequest request = Request(CTestPolicyServer::Url(47123));
        request.skipConnectionRequirements = c.fSkip;
        EXPECT_EQ(c.hrExpected, Send(request));
        EXPECT_EQ(c.rgCalls, RecordedCmCalls());
        ULONG ulCode = 0;
        if (c.usEvent != 0)
        {
            ASSERT_TRUE(Find(c.usEvent, &ulCode));
            EXPECT_EQ(c.ulEventCode, c.ulEventCode != 0 ? ulCode : 0);
        }
        EXPECT_EQ(c.usEvent == 30, Find(30));
        cRequests += SUCCEEDED(c.hrExpected) ? 1 : 0;
        EXPECT_EQ(cRequests, server.Requests().size());
    }
}

TEST_F(HttpsClientTest, NullArgumentsAreRefused)
{
    JsonRequest request = Request(CTestPolicyServer::Url(47129));
    JsonValue *pRoot = reinterpret_cast<JsonValue *>(1);
    EXPECT_EQ(E_INVALIDARG, OrvexJsonSendRequest(&request, nullptr));
    EXPECT_EQ(E_INVALIDARG, OrvexJsonSendRequest(nullptr, &pRoot));
    EXPECT_EQ(reinterpret_cast<JsonValue *>(1), pRoot); // untouched on failure
    JsonRequestContext *pContext = nullptr;
    EXPECT_EQ(E_INVALIDARG, OrvexJsonSend(&request, nullptr, nullptr, &pContext));
    EXPECT_EQ(E_INVALIDARG, OrvexJsonClose(nullptr));
    EXPECT_TRUE(Ids().empty());
}

// A trace session's keywords decide which events are written, by their class: error (19),
// information (12, 24) and verbose (27, 15, 99, 26). A 404 and then an object. How a level
// turns a class off is the common provider's (EventTraceTest) and each class's level is
// checked below.
TEST_F(HttpsClientTest, WritesOnlyWhatTheSessionEnabled)
{
    struct Case
    {
        const char *szName;
        UCHAR ucLevel;
        ULONGLONG ullKeywords;
        std::vector<USHORT> rgIds; // in the order written
    };
    const Case rgCases[] = {
        {"Everything", 0, ~0ull, {12, 19, 27, 15, 12, 24, 99, 26, 15}},
        {"ErrorsOnly", 5, 0x1, {19}},
        {"InformationAndVerbose", 5, 0x6, {12, 27, 15, 12, 24, 99, 26, 15}},
    };
    PolicyServerOptions notFound = ServerOn(47132, ARRAYSIZE(rgCases));
    notFound.iStatus = 404;
    CTestPolicyServer servers[2];
    ASSERT_TRUE(servers[0].Start(notFound));
    ASSERT_TRUE(servers[1].Start(ServerOn(47133, ARRAYSIZE(rgCases))));
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        m_session.Clear();
        TraceProviderEnableCallback(&ORVEXJSON_PROVIDER_GUID, EVENT_CONTROL_CODE_ENABLE_PROVIDER,
                                    c.ucLevel, c.ullKeywords, 0, nullptr,
                                    &g_OrvexJsonTraceProvider);
        EXPECT_EQ(c_hrStatus, Send(Request(CTestPolicyServer::Url(47132))));
        EXPECT_EQ(S_OK, Send(Request(CTestPolicyServer::Url(47133))));
        EXPECT_EQ(c.rgIds, Ids());
    }
}

// A real session filters on level and keyword together: each class's events carry both.
TEST(OrvexJsonTrace, EventsCarryTheLevelOfTheirKeyword)
{
    const EVENT_DESCRIPTOR *rgpClasses[c_cOrvexJsonTraceBits] = {
        &OrvexJsonEvent_HttpStatus, &OrvexJsonEvent_Sending, &OrvexJsonEvent_Body};
    for (ULONG i = 0; i < c_cOrvexJsonTraceBits; i++)
    {
        EXPECT_EQ(c_rgullOrvexJsonTraceKeywords[i], rgpClasses[i]->Keyword) << i;
        EXPECT_EQ(c_rgucOrvexJsonTraceLevels[i], rgpClasses[i]->Level) << i;
    }
}

// Where no trace session can listen (Wine), TELVANE_TRACE_STDOUT turns every event of the
// client's provider on when it registers and echoes each one as a debug line.
TEST_F(HttpsClientTest, TraceStdoutEchoesTheClientsEvents)
{
    m_session.Enable(false);
    ASSERT_TRUE(SetEnvironmentVariableW(L"TELVANE_TRACE_STDOUT", L"1"));
    testsupport::LogCapture log;

    HRESULT hr = Send(Request(L"ftp://localhost:47137/v1/api/config/udpecho"));
    SetEnvironmentVariableW(L"TELVANE_TRACE_STDOUT", nullptr);

    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_WINHTTP_UNRECOGNIZED_SCHEME), hr);
    EXPECT_EQ(std::vector<USHORT>({1}), Ids());
    EXPECT_TRUE(log.Contains(L"EventTrace: 1 0x80072ee6"));
}

// Wine never reports a secure failure, so this case hands the status callback the
// notification itself, while the real request waits on a listener that never answers its
// handshake. The completion runs once, with E_ACCESSDENIED; the real failure that follows
// calls nothing more. The client's provider is registered only while the context lives.
TEST_F(HttpsClientTest, SecureFailureCompletesOnce)
{
    WSADATA wsa;
    ASSERT_EQ(0, WSAStartup(MAKEWORD(2, 2), &wsa));
    SOCKET listener = socket(AF_INET, SOCK_STREAM, IPPROTO_TCP);
    ASSERT_NE(INVALID_SOCKET, listener);
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_port = htons(47142);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(0, bind(listener, reinterpret_cast<sockaddr *>(&address), sizeof(address)));
    ASSERT_EQ(0, listen(listener, 4));

    // Filled in on a WinHTTP thread; the test reads it once the event is set.
    struct Outcome
    {
        LONG cCalls = 0;
        HRESULT hr = S_OK;
        HANDLE hDone = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    } outcome;
    auto complete = [](void *pv, HRESULT hr, JsonValue *pRoot) {
        Outcome *p = static_cast<Outcome *>(pv);
        InterlockedIncrement(&p->cCalls);
        p->hr = hr;
        delete pRoot;
        SetEvent(p->hDone);
    };
    JsonRequest request = Request(CTestPolicyServer::Url(47142));
    JsonRequestContext *pContext = nullptr;
    EXPECT_EQ(0u, g_OrvexJsonTraceProvider.hRegistration);
    ASSERT_EQ(S_OK, OrvexJsonSend(&request, complete, &outcome, &pContext));
    EXPECT_NE(0u, g_OrvexJsonTraceProvider.hRegistration);

    DWORD dwFlags = WINHTTP_CALLBACK_STATUS_FLAG_INVALID_CA;
    OrvexJsonStatusCallback(nullptr, 0, WINHTTP_CALLBACK_STATUS_SECURE_FAILURE, &dwFlags,
                            sizeof(dwFlags)); // no context: ignored
    EXPECT_EQ(0, outcome.cCalls);
    OrvexJsonStatusCallback(nullptr, reinterpret_cast<DWORD_PTR>(pContext),
                            WINHTTP_CALLBACK_STATUS_SECURE_FAILURE, &dwFlags, sizeof(dwFlags));
    EXPECT_EQ(WAIT_OBJECT_0, WaitForSingleObject(outcome.hDone, INFINITE));
    EXPECT_EQ(c_hrAccessDenied, outcome.hr);
    ULONG ulCode = 0;
    ASSERT_TRUE(Find(16, &ulCode));
    EXPECT_EQ(static_cast<ULONG>(WINHTTP_CALLBACK_STATUS_FLAG_INVALID_CA), ulCode);

    // Closing the listener resets the waiting connection: the handshake then fails for real
    // and its request error finds the completion already taken.
    closesocket(listener);
    EXPECT_EQ(S_OK, OrvexJsonClose(pContext));
    EXPECT_EQ(0u, g_OrvexJsonTraceProvider.hRegistration);
    EXPECT_EQ(1, outcome.cCalls);
    EXPECT_EQ(c_hrAccessDenied, outcome.hr);
    EXPECT_TRUE(Find(22)); // the real failure came, and called nothing
    WSACleanup();
    CloseHandle(outcome.hDone);
}
} // namespace
