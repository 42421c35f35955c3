// Finds the device's client certificate for the HTTPS JSON client. Runs on the sender's
// thread of a request.
#pragma once

#include <windows.h>
#include <wincrypt.h>

// Has the certificate provisioned, then returns the first certificate of the current
// user's "MY" store whose enhanced key usage holds the device usage identifier. On
// success the caller frees *ppCertificate; on failure it is null and the failure's
// event of the client's provider has been written.
HRESULT DeviceCertificateFind(PCCERT_CONTEXT *ppCertificate);
