// The service's one network client: a blocking HTTPS request that answers with a JSON
// object, authenticated with the device's client certificate. The caller's thread blocks in
// OrvexJsonSendRequest; the request itself runs on the platform HTTP client's threads.
#pragma once

#include "lib/jsonvalue.h"

#include <windows.h>
#include <string>

// What to ask for. Every request goes over TLS, whatever the URL's scheme says, and is sent
// without a body.
struct JsonRequest
{
    std::wstring url;          // complete URL; host, port and path are cracked from it
    std::wstring verb;         // "GET"
    std::wstring userAgent;    // agent name of the session
    std::wstring extraHeaders; // further header lines (without a final CR LF); empty for none
    bool skipConnectionRequirements = false; // true: leave the connection manager out
    bool gzip = false;                       // true: ask for a compressed response
    bool ignoreCertErrors = false; // true: accept a server certificate with a bad name or date
};

// Results beside the platform's own HRESULTs.
const HRESULT c_hrOrvexJsonHttpStatus = static_cast<HRESULT>(0x80070490);   // status not 200
const HRESULT c_hrOrvexJsonEmptyBody = static_cast<HRESULT>(0x800700E8);    // 200, no body
const HRESULT c_hrOrvexJsonNotObject = static_cast<HRESULT>(0x8007000D);    // root not {...}
const HRESULT c_hrOrvexJsonTlsFailure = static_cast<HRESULT>(0x80070005);   // secure failure
const HRESULT c_hrOrvexJsonConnection = static_cast<HRESULT>(0x80004005);   // connection manager
const HRESULT c_hrOrvexJsonWaitFailed = static_cast<HRESULT>(0x80004004);   // wait failed
const HRESULT c_hrOrvexJsonBodyTooLarge = static_cast<HRESULT>(0x800710F0); // see below

// A policy is a few hundred bytes: a body larger than this fails the request with
// c_hrOrvexJsonBodyTooLarge (ERROR_MESSAGE_EXCEEDS_MAX_SIZE) instead of growing until the
// service runs out of memory.
const size_t c_cbOrvexJsonMaxBody = 1024 * 1024;

// Runs the request and waits for its outcome, however long the platform's own time-outs
// let it take. On success (S_OK) *ppRoot receives the root of the answer, an object node
// that the caller owns and deletes; on failure *ppRoot is left alone. A null pRequest or
// ppRoot gives E_INVALIDARG at once.
HRESULT OrvexJsonSendRequest(const JsonRequest *pRequest, JsonValue **ppRoot);
