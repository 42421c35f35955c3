// Where every trace test starts and ends: no delivery values, no "ConnID", no trace files, an
// empty submission spool and both stand-ins at their defaults. The fixture runs on the test
// thread; the state belongs to the prefix, which the suite's resource lock hands to one test.
#pragma once

#include "platform/deviceinfo/deviceinfocontrol.h"
#include "service/ctracedocument.h"
#include "platform/submission/submissioncontrol.h"
#include "tests/common/testsupport.h"
#include "tests/common/tracefiles.h"

#include <gtest/gtest.h>

namespace tracetest
{
const wchar_t c_wszConnIdKey[] = L"System\\CurrentControlSet\\Services\\Ambrel\\Parameters\\Config";
const wchar_t c_wszConnIdValue[] = L"ConnID";
// The run a test's documents belong to; any values do.
const GUID c_guidActivity = {
    0x6f1d2a40, 0x3c1e, 0x4b7a, {0x9d, 0x55, 0x1a, 0x2b, 0x3c, 0x4d, 0x5e, 0x6f}};
const GUID c_guidSession = {
    0x0a1b2c3d, 0x4e5f, 0x6071, {0x82, 0x93, 0xa4, 0xb5, 0xc6, 0xd7, 0xe8, 0xf9}};
const GUID c_guidLog = {
    0x12345678, 0x9abc, 0xdef0, {0x12, 0x34, 0x56, 0x78, 0x9a, 0xbc, 0xde, 0xf0}};

inline void ResetDeliveryState()
{
    testsupport::ResetDelivery();
    testsupport::HklmDeleteValue(c_wszConnIdKey, c_wszConnIdValue);
    testsupport::CreateFolders(L"C:\\Data\\Test");
    SubmissionClear();
    SubmissionSetResult(c_wszSubmissionInitResult, 0);
    SubmissionSetResult(c_wszSubmissionSubmitResult, 0);
    DeviceInfoReset();
}

class CDeliveryTest : public testing::Test
{
protected:
    void SetUp() override { ResetDeliveryState(); }
    void TearDown() override { ResetDeliveryState(); }
};

// One record whose payload is exactly these bytes (a NUL inside them included).
inline void Record(CTraceDocument &document, const GUID &id, const std::string &strBytes)
{
    document.RecordEvent(id, reinterpret_cast<const BYTE *>(strBytes.data()), strBytes.size());
}
} // namespace tracetest
