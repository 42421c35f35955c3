// Stand-in for the phone's crowdsourcing submission library: a profile that names the data
// and carries eight settings, and a submitter that takes the data. The stand-in keeps every
// accepted submission in its spool folder (submissioncontrol.h), one file each, and can be
// told to fail Init or SubmitData with a chosen code. One submitter is used by one thread at
// a time; several submitters may work at once on different threads or processes.
#pragma once

#include <windows.h>

#include <string>

// 120 bytes of caller storage. The default constructor prepares it; the caller then fills
// the name and the settings and leaves the library's own bytes alone.
class CrowdsourcingProfile_t
{
public:
    CrowdsourcingProfile_t();
    ~CrowdsourcingProfile_t();

    WCHAR wszProfileName[32]; // NUL-terminated
    DWORD rgdwSettings[8];
    BYTE rgbLibraryState[24]; // the library's; not touched by callers
};
static_assert(sizeof(CrowdsourcingProfile_t) == 120, "the profile is 120 bytes");

class CrowdsourcingDataSubmitter_t
{
public:
    // The profile is copied; the two texts and the number select an upload target other than
    // the profile's default (null, 0, null: the default).
    CrowdsourcingDataSubmitter_t(const CrowdsourcingProfile_t &profile, const wchar_t *wszTarget,
                                 int iTargetFlags, const wchar_t *wszTargetParameters);
    ~CrowdsourcingDataSubmitter_t();

    CrowdsourcingDataSubmitter_t(const CrowdsourcingDataSubmitter_t &) = delete;
    CrowdsourcingDataSubmitter_t &operator=(const CrowdsourcingDataSubmitter_t &) = delete;

    // 0 when the submitter is ready; otherwise a Win32 error code.
    DWORD Init();
    // Takes a copy of the data; 0 when accepted, otherwise a Win32 error code. pGuid names
    // the submission's correlation ID, or null for none.
    DWORD SubmitData(const BYTE *pbData, DWORD cbData, const GUID *pGuid);

private:
    BYTE m_rgbProfile[sizeof(CrowdsourcingProfile_t)];
    std::string m_strTarget; // the three target arguments as text
    bool m_fInitialized;
};
