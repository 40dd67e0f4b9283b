// The log facility against a recording logging library: what it registers, the two-step write,
// the scope tracer's pairing, and silence when the library or its operations are missing.

#include "LogFacility.h"
#include "FakeWemlo.h"
#include "ScopeTracer.h"

#include <gtest/gtest.h>
#include <stdexcept>
#include <string>

namespace {

// Loads the recording library afresh, with the given operations missing.
void loadFake(bool nullRegister = false, bool nullCheck = false, bool nullWrite = false)
{
    fakeWemloReset();
    fakeWemloSetNullOperations(nullRegister, nullCheck, nullWrite);
    LogFacility::reload(FAKE_WEMLO_PATH);
}

class LogFacilityTest : public ::testing::Test
{
protected:
    void SetUp() override { loadFake(); }
    void TearDown() override { loadFake(); }
};

int tracedWithEarlyReturns(int path)
{
    DELVIX_SCOPE_TRACE("Traced::function");
    for (int i = 0; i < 3; ++i) {
        if (i == path) {
            return i;
        }
    }
    if (path == 99) {
        throw std::runtime_error("out by exception");
    }
    return -1;
}

int g_evaluations = 0;
const char* countedArgument()
{
    ++g_evaluations;
    return "argument";
}

} // namespace

TEST_F(LogFacilityTest, RegistersThreeModulesAndWritesThroughTheLastOne)
{
    ASSERT_EQ(fakeWemloState().registeredModules,
              (std::vector<std::string>{"CameraProxy", "TamsaRetriever", "DelvixSrv"}));
    EXPECT_EQ(fakeWemloState().registerKinds, (std::vector<int>{19, 19, 19}));
    const int line = __LINE__ + 1;
    DELVIX_LOG(LogFacility::LevelError, "%s, %d", "X::f", 42);
    DELVIX_LOG(LogFacility::LevelSetting, "%s", "setting");
    const FakeWemloState state = fakeWemloState();
    ASSERT_EQ(state.lines.size(), 2u);
    // The fake hands out ids 7, 8, 9: DelvixSrv, registered third, got 9.
    EXPECT_EQ(state.lines[0].selector, (9 << 8) | 2);
    EXPECT_EQ(state.lines[1].selector, (9 << 8) | 3);
    EXPECT_EQ(state.lines[0].text, "X::f, 42");
    EXPECT_EQ(state.lines[0].line, line);
    EXPECT_NE(state.lines[0].sourcePath.find("LogFacilityTest.cpp"), std::string::npos);
}

TEST_F(LogFacilityTest, ScopeTracerLeavesOnceOnEveryWayOut)
{
    for (int path : {0, 1, 2, 7, 99}) {
        fakeWemloReset();
        if (path == 99) {
            EXPECT_THROW(tracedWithEarlyReturns(path), std::runtime_error);
        } else {
            tracedWithEarlyReturns(path);
        }
        const FakeWemloState state = fakeWemloState();
        ASSERT_EQ(state.lines.size(), 2u) << "path " << path;
        EXPECT_EQ(state.lines[0].text, "Traced::function, Enter");
        EXPECT_EQ(state.lines[1].text, "Traced::function, Leave");
        EXPECT_EQ(state.lines[0].selector & 0xff, 5);
        EXPECT_GT(state.lines[0].line, 0);
        EXPECT_EQ(state.lines[1].line, 0);
    }
}

TEST_F(LogFacilityTest, ARefusedOrMissingOperationWritesNothing)
{
    // A refused check evaluates no argument and writes nothing.
    fakeWemloSetCheckResult(1);
    g_evaluations = 0;
    DELVIX_LOG(LogFacility::LevelError, "%s", countedArgument());
    {
        DELVIX_SCOPE_TRACE("Refused::scope");
    }
    EXPECT_EQ(g_evaluations, 0);
    EXPECT_EQ(fakeWemloState().checkCalls, 3);
    EXPECT_EQ(fakeWemloState().writeCalls, 0);
    fakeWemloSetCheckResult(0);
    DELVIX_LOG(LogFacility::LevelError, "%s", countedArgument());
    EXPECT_EQ(g_evaluations, 1);
    EXPECT_EQ(fakeWemloState().writeCalls, 1);

    // No check operation: nothing is asked or written. No write operation: the check runs, the
    // line is dropped.
    for (const auto& [nullCheck, checks] : {std::pair{true, 0}, std::pair{false, 1}}) {
        loadFake(false, nullCheck, !nullCheck);
        DELVIX_LOG(LogFacility::LevelError, "%s", "dropped");
        EXPECT_EQ(fakeWemloState().checkCalls, checks);
        EXPECT_EQ(fakeWemloState().writeCalls, 0);
    }

    // No register operation: the object is still used, with module id 0.
    loadFake(true);
    DELVIX_LOG(LogFacility::LevelError, "%s", "kept");
    EXPECT_TRUE(fakeWemloState().registeredModules.empty());
    ASSERT_EQ(fakeWemloState().lines.size(), 1u);
    EXPECT_EQ(fakeWemloState().lines[0].selector, 2);

    // A missing library, or one without the entry point (the C runtime has none), is silence.
    for (const char* library : {"/nonexistent/folder/libWemloLogUtl.so", "libm.so.6"}) {
        fakeWemloReset();
        LogFacility::reload(library);
        EXPECT_FALSE(LogFacility::allow(LogFacility::LevelError, __FILE__, __LINE__));
        DELVIX_LOG(LogFacility::LevelError, "%s", "nowhere");
        {
            DELVIX_SCOPE_TRACE("Silent::scope");
        }
        EXPECT_EQ(fakeWemloState().checkCalls, 0);
    }
}
