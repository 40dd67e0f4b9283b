// The log facility against a recording logging library: registrations, the two-step write,
// the scope tracer's pairing, and silence when the library or its operations are missing.

#include "LogFacility.h"
#include "FakeWemlo.h"
#include "ScopeTracer.h"

#include <gtest/gtest.h>
#include <stdexcept>
#include <string>

namespace {

class LogFacilityTest : public ::testing::Test
{
protected:
    void SetUp() override { installFake(); }
    void TearDown() override
    {
        fakeWemloReset();
        LogFacility::reload(FAKE_WEMLO_PATH);
    }

    static void installFake()
    {
        fakeWemloReset();
        LogFacility::reload(FAKE_WEMLO_PATH);
    }

    static std::vector<std::string> texts()
    {
        std::vector<std::string> result;
        for (const FakeWemloLine& line : fakeWemloState().lines) {
            result.push_back(line.text);
        }
        return result;
    }
};

int tracedWithEarlyReturns(int path)
{
    DELVIX_SCOPE_TRACE("Traced::function");
    if (path == 0) {
        return 0;
    }
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

TEST_F(LogFacilityTest, RegistersThreeModulesAndWritesThroughDelvixSrv)
{
    const FakeWemloState state = fakeWemloState();
    ASSERT_EQ(state.registeredModules,
              (std::vector<std::string>{"CameraProxy", "TamsaRetriever", "DelvixSrv"}));
    EXPECT_EQ(state.registerKinds, (std::vector<int>{19, 19, 19}));

    const int line = __LINE__ + 1;
    DELVIX_LOG(LogFacility::LevelError, "%s, GetPluginObject failure", "X::f");
    DELVIX_LOG(LogFacility::LevelSetting, "%s Delvix", "Enable");
    const FakeWemloState after = fakeWemloState();
    ASSERT_EQ(after.lines.size(), 2u);
    // The fake hands out ids 7, 8, 9: DelvixSrv, registered third, got 9.
    EXPECT_EQ(after.lines[0].selector, (9 << 8) | 2);
    EXPECT_EQ(after.lines[1].selector, (9 << 8) | 3);
    EXPECT_EQ(after.lines[0].text, "X::f, GetPluginObject failure");
    EXPECT_EQ(after.lines[0].line, line);
    EXPECT_NE(after.lines[0].sourcePath.find("LogFacilityTest.cpp"), std::string::npos);
}

TEST_F(LogFacilityTest, ScopeTracerLeavesOnceOnEveryWayOut)
{
    for (int path : {0, 1, 2, 7}) {
        fakeWemloReset();
        tracedWithEarlyReturns(path);
        EXPECT_EQ(texts(), (std::vector<std::string>{"Traced::function, Enter", "Traced::function, Leave"}))
            << "path " << path;
    }
    fakeWemloReset();
    EXPECT_THROW(tracedWithEarlyReturns(99), std::runtime_error);
    EXPECT_EQ(texts(), (std::vector<std::string>{"Traced::function, Enter", "Traced::function, Leave"}));

    const FakeWemloState state = fakeWemloState();
    EXPECT_EQ(state.lines[0].selector & 0xff, 5);
    EXPECT_GT(state.lines[0].line, 0);
    EXPECT_EQ(state.lines[1].line, 0);
}

TEST_F(LogFacilityTest, RefusedCheckWritesNothingAndEvaluatesNoArgument)
{
    fakeWemloSetCheckResult(1);
    g_evaluations = 0;
    DELVIX_LOG(LogFacility::LevelError, "%s", countedArgument());
    {
        DELVIX_SCOPE_TRACE("Refused::scope");
    }
    const FakeWemloState state = fakeWemloState();
    EXPECT_EQ(g_evaluations, 0);
    EXPECT_EQ(state.checkCalls, 3);
    EXPECT_EQ(state.writeCalls, 0);

    fakeWemloSetCheckResult(0);
    DELVIX_LOG(LogFacility::LevelError, "%s", countedArgument());
    EXPECT_EQ(g_evaluations, 1);
    EXPECT_EQ(fakeWemloState().writeCalls, 1);
}

TEST_F(LogFacilityTest, NullOperationsAreSkipped)
{
    // No check operation: nothing is asked and nothing is written.
    fakeWemloReset();
    fakeWemloSetNullOperations(false, true, false);
    LogFacility::reload(FAKE_WEMLO_PATH);
    DELVIX_LOG(LogFacility::LevelError, "%s", "dropped");
    EXPECT_EQ(fakeWemloState().writeCalls, 0);
    EXPECT_EQ(fakeWemloState().checkCalls, 0);

    // No write operation: the check runs, the line is dropped, nothing breaks.
    fakeWemloReset();
    fakeWemloSetNullOperations(false, false, true);
    LogFacility::reload(FAKE_WEMLO_PATH);
    DELVIX_LOG(LogFacility::LevelError, "%s", "dropped");
    EXPECT_EQ(fakeWemloState().checkCalls, 1);
    EXPECT_EQ(fakeWemloState().writeCalls, 0);

    // No register operation: the object is still used, with module id 0.
    fakeWemloReset();
    fakeWemloSetNullOperations(true, false, false);
    LogFacility::reload(FAKE_WEMLO_PATH);
    DELVIX_LOG(LogFacility::LevelError, "%s", "kept");
    const FakeWemloState state = fakeWemloState();
    EXPECT_TRUE(state.registeredModules.empty());
    ASSERT_EQ(state.lines.size(), 1u);
    EXPECT_EQ(state.lines[0].selector, 2);
}

TEST_F(LogFacilityTest, MissingLibraryOrEntryPointSilencesLogging)
{
    LogFacility::reload("/nonexistent/folder/libWemloLogUtl.so");
    EXPECT_FALSE(LogFacility::allow(LogFacility::LevelError, __FILE__, __LINE__));
    DELVIX_LOG(LogFacility::LevelError, "%s", "nowhere");
    {
        DELVIX_SCOPE_TRACE("Silent::scope");
    }
    // A library without the entry point (the C runtime has none) is the same as none.
    LogFacility::reload("libm.so.6");
    EXPECT_FALSE(LogFacility::allow(LogFacility::LevelError, __FILE__, __LINE__));
    EXPECT_EQ(fakeWemloState().checkCalls, 0);
}
