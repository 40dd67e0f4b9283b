// The log facility against a recording logging library: registration, the two-step write, the
// scope tracer's pairing, and silence when the library or its operations are missing.

#include "LogFacility.h"
#include "CameraProxy.h"
#include "FakeWemlo.h"
#include "HostFakes.h"
#include "PluginDelvixSrv.h"
#include "ScopeTracer.h"

#include <gtest/gtest.h>
#include <stdexcept>

namespace {

// Every line written by `logging` after a reload (of the recording library with the given operations missing,
// or of `library`) as "checks, writes, selector:text;...".
std::string written(const std::function<void()>& logging, int missing = 0,
                    const char* library = FAKE_WEMLO_PATH)
{
    fakeWemloReset();
    fakeWemloSetNullOperations(missing == 1, missing == 2, missing == 3);
    LogFacility::reload(library);
    logging();
    const FakeWemloState state = fakeWemloState();
    std::string text =
        std::to_string(state.checkCalls) + " checks " + std::to_string(state.writeCalls) + " writes ";
    for (const auto& line : state.lines) {
        text += (&line == &state.lines.front() ? "" : ";") + std::to_string(line.selector) + ':' + line.text;
    }
    return text;
}

// Leaves the traced scope normally, or for 99 by an exception.
void traced(int path = 0)
{
    try {
        DELVIX_SCOPE_TRACE("Traced::function");
        path == 99 ? throw std::runtime_error("out by exception") : void();
    } catch (const std::runtime_error&) {
    }
}

// A camera directory whose teardown shows in the log.
class LoggingCollector : public FakeCollector
{
public:
    ~LoggingCollector() override { DELVIX_LOG(LogFacility::LevelError, "%s", "collector released"); }
};

} // namespace

TEST(LogFacilityTest, WritesThroughTheLastModuleTracesEveryWayOutAndIsSilentWithoutAnOperation)
{
    int line = 0;
    // The fake hands out ids 7, 8, 9: DelvixSrv, registered third, got 9.
    EXPECT_EQ(written([&] {
                  line = __LINE__ + 1;
                  DELVIX_LOG(LogFacility::LevelError, "%s, %d", "X::f", 42);
                  DELVIX_LOG(LogFacility::LevelSetting, "%s", "setting");
              }),
              "2 checks 2 writes 2306:X::f, 42;2307:setting");
    EXPECT_EQ(fakeWemloState().registeredModules,
              (std::vector<std::string>{"CameraProxy", "TamsaRetriever", "DelvixSrv"}));
    EXPECT_EQ(fakeWemloState().lines[0].line, line);
    EXPECT_NE(fakeWemloState().lines[0].sourcePath.find("LogFacilityTest.cpp"), std::string::npos);
    for (int path : {0, 2, 99}) {
        EXPECT_EQ(written([&] { traced(path); }),
                  "2 checks 2 writes 2309:Traced::function, Enter;2309:Traced::function, Leave")
            << path;
    }

    // A camera whose port cannot be used is named with the port before the client refuses the call.
    EXPECT_NE(written([] {
                  CameraProxy(std::make_shared<RecordingHttpClient>())
                      .sendPairTokenRequest({{"Name", "cam9"}, {"IP", "10.0.0.9"}, {"Port", 70000}});
              }).find("CameraProxy::get, camera cam9 has no usable port: 70000"),
              std::string::npos);

    // A refused check evaluates no argument and writes nothing.
    int evaluations = 0;
    const auto counted = [&] { return ++evaluations, "argument"; };
    EXPECT_EQ(written([&] {
                  fakeWemloSetCheckResult(1);
                  DELVIX_LOG(LogFacility::LevelError, "%s", counted());
                  traced();
              }) + std::to_string(evaluations),
              "3 checks 0 writes 0");
    // No check operation: nothing is asked or written. No write operation: the line is dropped.
    // No register operation: the object is still used, with module id 0. A library without the
    // entry point (the C runtime has none) is silence.
    const auto logging = [] {
        DELVIX_LOG(LogFacility::LevelError, "%s", "kept");
        traced();
    };
    EXPECT_EQ(written(logging, 1),
              "3 checks 3 writes 2:kept;5:Traced::function, Enter;5:Traced::function, Leave");
    EXPECT_EQ(written(logging, 2), "0 checks 0 writes ");
    EXPECT_EQ(written(logging, 3), "3 checks 0 writes ");
    EXPECT_EQ(written(logging, 0, "libm.so.6"), "0 checks 0 writes ");
    written([] {});
}

TEST(LogFacilityTest, PluginTracesItsEntryPointsAndLeavesBeforeItsComponentsGo)
{
    TestTools tools;
    written([&] {
        auto plugin = std::make_unique<PluginDelvixSrv>();
        plugin->setCameraInformationCollector(
            QSharedPointer<ICameraInformationCollector>(new LoggingCollector));
        plugin->InitialPluginBase(&tools);
        plugin->AllPluginLoaded();
        plugin.reset();
    });
    std::string traces;
    for (const auto& line : fakeWemloState().lines) {
        const bool teardown = line.text.find("released") != std::string::npos;
        traces += line.selector == 2309 || teardown ? line.text + ";" : "";
    }
    EXPECT_EQ(traces, "PluginDelvixSrv::InitialPluginBase, Enter;PluginDelvixSrv::InitialPluginBase, Leave;"
                      "PluginDelvixSrv::~PluginDelvixSrv, Enter;PluginDelvixSrv::~PluginDelvixSrv, Leave;"
                      "collector released;");
}
