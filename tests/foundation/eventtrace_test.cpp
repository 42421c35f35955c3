#include "servicelib/eventtrace.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <mutex>
#include <string>
#include <vector>

namespace
{
struct WrittenEvent
{
    USHORT usId;
    UCHAR ucLevel;
    USHORT usTask;
    ULONGLONG ullKeyword;
    std::vector<std::string> rgPayload; // one entry per data descriptor, raw bytes
};

std::mutex s_lock;
std::vector<WrittenEvent> s_rgEvents;

void CaptureWrite(REGHANDLE, const EVENT_DESCRIPTOR *pDescriptor, ULONG cData,
                  const EVENT_DATA_DESCRIPTOR *pData)
{
    WrittenEvent event{
        pDescriptor->Id, pDescriptor->Level, pDescriptor->Task, pDescriptor->Keyword, {}};
    for (ULONG i = 0; i < cData; i++)
    {
        event.rgPayload.emplace_back(reinterpret_cast<const char *>(pData[i].Ptr), pData[i].Size);
    }
    std::lock_guard<std::mutex> guard(s_lock);
    s_rgEvents.push_back(event);
}

// Captures written events and acts as a trace session on the main provider; the events are
// written on the test's main thread, which owns the capture.
class EventTraceTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        s_rgEvents.clear();
        TraceSetWriteHook(CaptureWrite);
    }
    void TearDown() override
    {
        Session(EVENT_CONTROL_CODE_DISABLE_PROVIDER, 0, 0, 0);
        TraceSetWriteHook(nullptr);
    }
    static void Session(ULONG ulCode, UCHAR ucLevel, ULONGLONG ullAny, ULONGLONG ullAll)
    {
        TraceProviderEnableCallback(&TELVANE_PROVIDER_GUID, ulCode, ucLevel, ullAny, ullAll,
                                    nullptr, &g_TelvaneTraceProvider);
    }
    static std::vector<bool> Bits()
    {
        return {TelvaneTraceEnabled(TelvaneTraceBitMessage),
                TelvaneTraceEnabled(TelvaneTraceBitFailure),
                TelvaneTraceEnabled(TelvaneTraceBitUdp)};
    }
};

std::string Bytes(const void *pv, size_t cb)
{
    return std::string(static_cast<const char *>(pv), cb);
}
} // namespace

TEST_F(EventTraceTest, EnableCallbackSetsBitsAndOnlyEnabledEventsAreWritten)
{
    using Bits3 = std::vector<bool>;
    EXPECT_EQ(Bits3({false, false, false}), Bits());

    Session(EVENT_CONTROL_CODE_ENABLE_PROVIDER, 0, 0x100, 0); // level 0 means any level
    EXPECT_EQ(Bits3({true, true, false}), Bits());

    Session(EVENT_CONTROL_CODE_ENABLE_PROVIDER, 3, 0x100, 0); // failures need level 4
    EXPECT_EQ(Bits3({true, false, false}), Bits());
    Session(EVENT_CONTROL_CODE_ENABLE_PROVIDER, 4, 0x100, 0);
    EXPECT_EQ(Bits3({true, true, false}), Bits());

    Session(EVENT_CONTROL_CODE_ENABLE_PROVIDER, 5, 0x500, 0);
    EXPECT_EQ(Bits3({true, true, true}), Bits());

    Session(EVENT_CONTROL_CODE_ENABLE_PROVIDER, 5, 0x500, 0x400); // match-all filters 0x100
    EXPECT_EQ(Bits3({false, false, true}), Bits());

    Session(EVENT_CONTROL_CODE_CAPTURE_STATE, 0, 0, 0); // other notifications change nothing
    EXPECT_EQ(Bits3({false, false, true}), Bits());

    Session(EVENT_CONTROL_CODE_DISABLE_PROVIDER, 0, 0, 0);
    EXPECT_EQ(Bits3({false, false, false}), Bits());
    // Without a session nothing is written; keyword 0x400 alone enables the UDP failures.
    TelvaneTrace("x");
    TelvaneTraceF("%d", 1);
    TelvaneTraceFailure("x", 1);
    TelvaneTraceUdpFailure("x", 1);
    TelvaneTraceMark(TelvaneEvent_UdpConfigRead);
    TelvaneTraceCommandLine(L"x");
    EXPECT_TRUE(s_rgEvents.empty());
    Session(EVENT_CONTROL_CODE_ENABLE_PROVIDER, 0, 0x400, 0);
    TelvaneTrace("x");
    TelvaneTraceFailure("x", 1);
    TelvaneTraceUdpFailure("y", 1);
    ASSERT_EQ(1u, s_rgEvents.size());
    EXPECT_EQ(2001, s_rgEvents[0].usId);
}

TEST_F(EventTraceTest, PayloadsAndDescriptors)
{
    Session(EVENT_CONTROL_CODE_ENABLE_PROVIDER, 0, 0x500, 0);
    TelvaneTrace("CServiceActivity::Destroy()");
    TelvaneTrace(nullptr);
    TelvaneTraceF("%s - %d", "CThing::Run()", 7);
    TelvaneTraceFailure("***CServiceActivity - invalid opcode, closing pipe", 0x12345678);
    TelvaneTraceUdpFailure(nullptr, 5);
    TelvaneTraceMark(TelvaneEvent_UdpConfigRefresh);
    TelvaneTraceCommandLine(L"a b");
    TelvaneTraceCommandLine(nullptr);

    ASSERT_EQ(8u, s_rgEvents.size());
    EXPECT_EQ(1001, s_rgEvents[0].usId);
    EXPECT_EQ(2, s_rgEvents[0].usTask);
    EXPECT_EQ(0x100u, s_rgEvents[0].ullKeyword);
    EXPECT_EQ(std::vector<std::string>{Bytes("CServiceActivity::Destroy()", 28)},
              s_rgEvents[0].rgPayload);
    EXPECT_EQ(std::vector<std::string>{Bytes("NULL", 5)}, s_rgEvents[1].rgPayload);
    EXPECT_EQ(std::vector<std::string>{Bytes("CThing::Run() - 7", 18)}, s_rgEvents[2].rgPayload);

    EXPECT_EQ(1002, s_rgEvents[3].usId);
    EXPECT_EQ(4, s_rgEvents[3].ucLevel);
    EXPECT_EQ(1, s_rgEvents[3].usTask);
    ASSERT_EQ(2u, s_rgEvents[3].rgPayload.size());
    EXPECT_EQ(Bytes("\x78\x56\x34\x12", 4), s_rgEvents[3].rgPayload[1]);

    EXPECT_EQ(2001, s_rgEvents[4].usId);
    EXPECT_EQ(0x400u, s_rgEvents[4].ullKeyword);
    EXPECT_EQ(Bytes("NULL", 5), s_rgEvents[4].rgPayload[0]);
    EXPECT_EQ(Bytes("\x05\0\0\0", 4), s_rgEvents[4].rgPayload[1]);

    EXPECT_EQ(2005, s_rgEvents[5].usId);
    EXPECT_TRUE(s_rgEvents[5].rgPayload.empty());

    EXPECT_EQ(2008, s_rgEvents[6].usId);
    EXPECT_EQ(std::vector<std::string>{Bytes(L"a b", 8)}, s_rgEvents[6].rgPayload);
    EXPECT_EQ(std::vector<std::string>{Bytes(L"NULL", 10)}, s_rgEvents[7].rgPayload);
}

TEST(EventTraceRegistration, RegistersOnceAndUnregistersOnce)
{
    TRACE_PROVIDER_CONTEXT context = g_TelvaneTraceProvider;
    context.hRegistration = 0;
    const GUID guid = {
        0x4637124C, 0x1D40, 0x4B4D, {0x89, 0x2F, 0x2A, 0xAE, 0xCF, 0x24, 0xFF, 0x06}};
    // A handle that is already there is kept (Wine hands out one constant handle, so only
    // a value of our own shows whether registration ran again).
    const REGHANDLE hExisting = 0x5E7;
    context.hRegistration = hExisting;
    TraceProviderRegister(guid, &context);
    EXPECT_EQ(hExisting, context.hRegistration);

    context.hRegistration = 0;
    TraceProviderRegister(guid, &context);
    EXPECT_NE(0u, context.hRegistration);
    TraceProviderUnregister(&context);
    EXPECT_EQ(0u, context.hRegistration);
    TraceProviderUnregister(&context);
    EXPECT_EQ(0u, context.hRegistration);
}

TEST(EventTraceEcho, EnvironmentVariableEchoesEveryEvent)
{
    const std::wstring child = L"\"" + testsupport::BinDir() + L"foundation_child.exe\" trace";
    // The quiet run inherits this process's environment, which may come with the variable.
    SetEnvironmentVariableW(L"TELVANE_TRACE_STDOUT", nullptr);
    testsupport::ChildResult quiet = testsupport::RunChild(child);
    EXPECT_EQ(0u, quiet.dwExitCode);
    EXPECT_EQ(std::string::npos, quiet.strOutput.find("1001")) << quiet.strOutput;

    testsupport::ChildResult echo = testsupport::RunChild(child, {L"TELVANE_TRACE_STDOUT=1"});
    EXPECT_EQ(0u, echo.dwExitCode);
    const char *rgszExpected[] = {
        "EventTrace: 1001 ChildMain() - hello\r\n",
        "EventTrace: 1002 ***Child - bad opcode 0x1234\r\n",
        "EventTrace: 2001 CreateFile (read) 0x2\r\n",
        "EventTrace: 2006\r\n",
        "EventTrace: 2008 C:\\programs\\app.exe -x\r\n",
    };
    for (const char *sz : rgszExpected)
    {
        EXPECT_NE(std::string::npos, echo.strOutput.find(sz)) << sz << "\n" << echo.strOutput;
    }

    // Set but empty still counts as set, whatever error the thread saw before.
    testsupport::ChildResult empty = testsupport::RunChild(child, {L"TELVANE_TRACE_STDOUT="});
    EXPECT_EQ(0u, empty.dwExitCode);
    EXPECT_NE(std::string::npos, empty.strOutput.find(rgszExpected[0])) << empty.strOutput;
}
