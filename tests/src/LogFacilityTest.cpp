// The log facility against a recording logging library: registration, the two-step write, the
// scope tracer's pairing, and silence when the library or its operations are missing.

#include "LogFacility.h"
#include "FakeWemlo.h"
#include "ScopeTracer.h"

#include <QString>
#include <QStringList>
#include <gtest/gtest.h>
#include <stdexcept>

namespace {

// Loads the recording library afresh, with the given operations missing.
void loadFake(bool nullRegister = false, bool nullCheck = false, bool nullWrite = false)
{
    fakeWemloReset();
    fakeWemloSetNullOperations(nullRegister, nullCheck, nullWrite);
    LogFacility::reload(FAKE_WEMLO_PATH);
}

// Every line written so far as "selector:text", and the check and write counts.
std::string written()
{
    QStringList lines;
    for (const auto& line : fakeWemloState().lines) {
        lines << QStringLiteral("%1:%2").arg(line.selector).arg(QString::fromStdString(line.text));
    }
    return QStringLiteral("%1 checks %2 writes %3")
        .arg(fakeWemloState().checkCalls)
        .arg(fakeWemloState().writeCalls)
        .arg(lines.join(';'))
        .toStdString();
}

int traced(int path)
{
    DELVIX_SCOPE_TRACE("Traced::function");
    if (path == 99) {
        throw std::runtime_error("out by exception");
    }
    return path > 0 ? path : -1;
}

const char* countedArgument(int* evaluations)
{
    ++*evaluations;
    return "argument";
}

} // namespace

TEST(LogFacilityTest, WritesThroughTheLastModuleAndTracesEveryWayOut)
{
    loadFake();
    EXPECT_EQ(fakeWemloState().registeredModules,
              (std::vector<std::string>{"CameraProxy", "TamsaRetriever", "DelvixSrv"}));
    const int line = __LINE__ + 1;
    DELVIX_LOG(LogFacility::LevelError, "%s, %d", "X::f", 42);
    DELVIX_LOG(LogFacility::LevelSetting, "%s", "setting");
    // The fake hands out ids 7, 8, 9: DelvixSrv, registered third, got 9.
    EXPECT_EQ(written(), "2 checks 2 writes 2306:X::f, 42;2307:setting");
    EXPECT_EQ(fakeWemloState().lines[0].line, line);
    EXPECT_NE(fakeWemloState().lines[0].sourcePath.find("LogFacilityTest.cpp"), std::string::npos);
    for (int path : {0, 2, 99}) {
        fakeWemloReset();
        try {
            traced(path);
        } catch (const std::runtime_error&) {
        }
        EXPECT_EQ(written(), "2 checks 2 writes 2309:Traced::function, Enter;2309:Traced::function, Leave")
            << path;
    }
}

TEST(LogFacilityTest, ARefusedOrMissingOperationWritesNothing)
{
    // A refused check evaluates no argument and writes nothing.
    loadFake();
    int evaluations = 0;
    fakeWemloSetCheckResult(1);
    DELVIX_LOG(LogFacility::LevelError, "%s", countedArgument(&evaluations));
    traced(1);
    EXPECT_EQ(written() + std::to_string(evaluations), "3 checks 0 writes 0");

    // No check operation: nothing is asked or written. No write operation: the line is dropped.
    // No register operation: the object is still used, with module id 0.
    for (const auto& [missing, expected] :
         {std::pair{1, "1 checks 1 writes 2:kept"}, std::pair{2, "0 checks 0 writes "},
          std::pair{3, "1 checks 0 writes "}}) {
        loadFake(missing == 1, missing == 2, missing == 3);
        DELVIX_LOG(LogFacility::LevelError, "%s", "kept");
        EXPECT_EQ(written(), expected) << missing;
    }

    // A missing library, or one without the entry point (the C runtime has none), is silence.
    for (const char* library : {"/nonexistent/folder/libWemloLogUtl.so", "libm.so.6"}) {
        fakeWemloReset();
        LogFacility::reload(library);
        EXPECT_FALSE(LogFacility::allow(LogFacility::LevelError, __FILE__, __LINE__));
        DELVIX_LOG(LogFacility::LevelError, "%s", "nowhere");
        traced(1);
        EXPECT_EQ(written(), "0 checks 0 writes ");
    }
    loadFake();
}
