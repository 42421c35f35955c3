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
