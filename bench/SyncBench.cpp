// One synchronisation pass over 200 simulated cameras, each answering a 60 s window of about 50
// objects, through the real HTTP client, proxy and synchroniser. Reports the wall time of the
// pass and the plug-in's CPU time per answer (the process's CPU time minus the cameras' thread).
#include "BraskHttpClient.h"
#include "CameraSimulator.h"
#include "CameraSynchronizer.h"

#include <QCoreApplication>
#include <QDir>
#include <QEventLoop>
#include <QTemporaryDir>
#include <QTimer>
#include <benchmark/benchmark.h>

#include <ctime>

namespace {

constexpr int kCameras = 200;

double cpuSeconds(clockid_t clock)
{
    timespec ts{};
    clock_gettime(clock, &ts);
    return double(ts.tv_sec) + double(ts.tv_nsec) * 1e-9;
}

// Waits in the event loop (sleeping, not spinning, so the wait costs no CPU) until poke() finds
// the condition met, or the limit passes.
class Waiter
{
public:
    bool wait(const std::function<bool()>& condition, int limitMs)
    {
        m_condition = condition;
        if (!condition()) {
            QEventLoop loop;
            m_loop = &loop;
            QTimer::singleShot(limitMs, &loop, &QEventLoop::quit);
            loop.exec();
            m_loop = nullptr;
        }
        return condition();
    }
    void poke()
    {
        if (m_loop && m_condition()) {
            m_loop->quit();
        }
    }

private:
    std::function<bool()> m_condition;
    QEventLoop* m_loop = nullptr;
};

void BM_SyncPass200Cameras(benchmark::State& state)
{
    QTemporaryDir dir; // default settings: period 60 s, delay 180 s
    QDir::setCurrent(dir.path());
    QList<CameraSetup> setups;
    for (int i = 0; i < kCameras; ++i) {
        CameraSetup setup;
        setup.name = QStringLiteral("cam%1").arg(i, 3, 10, QLatin1Char('0'));
        setup.objectsPerMinute = 50;
        setup.protectedMetadata = i % 10 == 0; // every tenth camera asks for an access token
        setups.append(setup);
    }
    CameraSimulator cameras;
    if (!cameras.start(setups)) {
        state.SkipWithError("cameras did not start");
        return;
    }
    auto proxy = std::make_shared<CameraProxy>(std::make_shared<BraskHttpClient>());
    CameraSynchronizer sync(proxy);
    Waiter waiter;
    int tokens = 0, answers = 0, objects = 0, failures = 0;
    QObject::connect(proxy.get(), &CameraProxy::receivePairToken, [&] {
        ++tokens;
        waiter.poke();
    });
    QObject::connect(proxy.get(), &CameraProxy::requestFailed, [&] {
        ++failures;
        waiter.poke();
    });
    QObject::connect(&sync, &CameraSynchronizer::receiveResponseData,
                     [&](const QVariantMap&, unsigned int, const QVariantMap& data) {
                         ++answers;
                         objects += data.value(QStringLiteral("count")).toInt();
                         waiter.poke();
                     });
    sync.updateInformation(cameras.directoryMap());
    if (!waiter.wait([&] { return tokens == kCameras / 10; }, 30000)) {
        state.SkipWithError("pair tokens did not arrive");
        return;
    }

    double pluginCpu = 0;
    qint64 totalAnswers = 0, totalObjects = 0;
    for (auto _ : state) {
        state.PauseTiming();
        sync.updateLastSync(QVariantMap()); // every camera one window behind again
        answers = objects = failures = 0;
        double camerasBefore = 0, camerasAfter = 0;
        cameras.runOnCameraThread([&] { camerasBefore = cpuSeconds(CLOCK_THREAD_CPUTIME_ID); });
        const double processBefore = cpuSeconds(CLOCK_PROCESS_CPUTIME_ID);
        state.ResumeTiming();

        sync.synchronize();
        if (!waiter.wait([&] { return answers + failures == kCameras; }, 60000)) {
            state.SkipWithError("not every camera answered");
            return;
        }

        state.PauseTiming();
        const double processAfter = cpuSeconds(CLOCK_PROCESS_CPUTIME_ID);
        cameras.runOnCameraThread([&] { camerasAfter = cpuSeconds(CLOCK_THREAD_CPUTIME_ID); });
        pluginCpu += (processAfter - processBefore) - (camerasAfter - camerasBefore);
        totalAnswers += answers;
        totalObjects += objects;
        if (failures > 0) {
            state.SkipWithError("some windows failed");
            return;
        }
        state.ResumeTiming();
    }
    state.counters["answers_per_pass"] = double(totalAnswers) / double(state.iterations());
    state.counters["objects_per_answer"] = totalAnswers ? double(totalObjects) / double(totalAnswers) : 0;
    state.counters["plugin_cpu_ms_per_answer"] = totalAnswers ? pluginCpu * 1000.0 / double(totalAnswers) : 0;
}

} // namespace

BENCHMARK(BM_SyncPass200Cameras)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(3);

int main(int argc, char** argv)
{
    QCoreApplication app(argc, argv);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
