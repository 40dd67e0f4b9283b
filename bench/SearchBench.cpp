// What a search costs the plug-in itself, and what the two search commands take end to end.
//
// In memory: the conversion of one result record (a 20 KB thumbnail text with a 512-number
// feature and a base64 image) into a search record, by the fast reader and by QJsonDocument,
// and "startSearch" from Request to the final reply over a store that hands the same record out
// 201 times (so the figure is conversion, scheduling and relay, per hit).
//
// Seeded store (with --seeded-store=DIR): "startSearch" and "startReIdSearch" over a store of
// --seed-objects objects (default 1,000,000) in --seed-locations locations (default 100),
// seeded into DIR/Server on first use, which takes minutes.
// Medians come from the repetitions (`--benchmark_repetitions` overrides the default of 9).

#include "AttributeRetriever.h"
#include "DelvixKeys.h"
#include "ICameraInformationCollector.h"
#include "PluginDelvixSrv.h"
#include "Tamsa.h"
#include "TamsaImplement.h"
#include "TamsaSeeder.h"

#include <QCoreApplication>
#include <QDir>
#include <QFile>
#include <QSettings>
#include <benchmark/benchmark.h>

#include <algorithm>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <mutex>
#include <random>
#include <string>

namespace {

constexpr int kHits = AttributeQueryWorker::kMaxHits;

std::string hitThumbnails()
{
    std::mt19937 random(42);
    std::uniform_real_distribution<double> value(-0.2, 0.2);
    static const char alphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    std::string image(13500, 'A');
    for (char& c : image) {
        c = alphabet[random() % 64];
    }
    std::string text = "{\"Thumbnail\":[{\"image\":\"" + image + "\",\"feature\":[";
    char number[32];
    for (int i = 0; i < 512; ++i) {
        // Nine significant digits, as the store writes a float.
        std::snprintf(number, sizeof number, "%s%.9g", i ? "," : "", double(float(value(random))));
        text += number;
    }
    return text + "]}]}";
}

const std::string& thumbnails()
{
    static const std::string text = hitThumbnails();
    return text;
}

const char* const kAttributes =
    R"({"Age":"adult","Gender":1,"Accessories":[2],"UpperColor":[3,4],"LowerColor":[5]})";
const double kTrajectory[] = {0.1, 0.2, 0.3, 0.4, 0.5, 0.6, 0.7, 0.8};

TTAMSA_OBJECTMETAINFO_RESULT hitRecord()
{
    TTAMSA_OBJECTMETAINFO_RESULT result;
    std::memset(&result, 0, sizeof result);
    result.wSize = sizeof result;
    result.qwObjectId = 123456;
    result.dwLocationNumber = 1;
    result.pszObjectType = "Human";
    result.pszAttributes = kAttributes;
    result.dwStartTime = 1704067200;
    result.dwEndTime = 1704067230;
    result.pTrajectory = kTrajectory;
    result.dwTrajectoryBytes = sizeof kTrajectory;
    result.pszThumbnails = thumbnails().c_str();
    return result;
}

// A store that hands out the same record, from memory, without end.
class MemoryStore : public TamsaWrapper
{
public:
    long initDatabase(void** database) override
    {
        *database = this;
        return 0;
    }
    long releaseDatabase(void** database) override
    {
        *database = nullptr;
        return 0;
    }
    long GetObjectMetaInfoFirst(void*, const TTAMSA_OBJECTMETAINFO_QUERY*, void** search) override
    {
        *search = this;
        return 0;
    }
    long GetObjectMetaInfoNext(void*, TTAMSA_OBJECTMETAINFO_RESULT* result) override
    {
        *result = hitRecord();
        return 0;
    }
    void GetObjectMetaInfoClose(void*) override {}
    void GetObjectMetaInfoAbort(void*) override {}
    QString getStoragesDBPath() override { return QString(); }
};

class FixedCollector : public ICameraInformationCollector
{
public:
    void writeData(int, int, const QString&) override {}
    void setDelvixSettings(const QVariantMap&) override {}
    QString getCameraNodeID(const QString& location) override
    {
        return location == QLatin1String("Loc1") ? QStringLiteral("camera-1") : QString();
    }
};

// Replies of one request; the final one wakes the waiting benchmark.
class ReplyWaiter
{
public:
    HDLR_DO_REQUEST_CB callback()
    {
        return [this](bool bFinal, const QString&, const QString&, const QVariant& payload) {
            std::lock_guard<std::mutex> lock(m_mutex);
            if (bFinal) {
                m_done = true;
                m_changed.notify_all();
            } else {
                ++m_hits;
                benchmark::DoNotOptimize(payload);
            }
        };
    }
    int wait()
    {
        std::unique_lock<std::mutex> lock(m_mutex);
        m_changed.wait(lock, [this] { return m_done; });
        return m_hits;
    }

private:
    std::mutex m_mutex;
    std::condition_variable m_changed;
    bool m_done = false;
    int m_hits = 0;
};

int g_client = 0;

RequestSenderInfo benchSender()
{
    RequestSenderInfo sender;
    sender.senderHandle = &g_client;
    return sender;
}

void BM_HitConversion(benchmark::State& state, AttributeQueryWorker::JsonRoute route)
{
    const TTAMSA_OBJECTMETAINFO_RESULT result = hitRecord();
    for (auto _ : state) {
        QVariantMap record = AttributeQueryWorker::toSearchRecord(result, route);
        benchmark::DoNotOptimize(record);
    }
    state.counters["text_bytes"] = double(thumbnails().size());
}
BENCHMARK_CAPTURE(BM_HitConversion, fast, AttributeQueryWorker::JsonRoute::Fast)
    ->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(BM_HitConversion, qt_document, AttributeQueryWorker::JsonRoute::QtDocument)
    ->Unit(benchmark::kMicrosecond);

// Request to final reply over the in-memory store: the plug-in's whole cost of 201 hits.
void BM_StartSearchInMemory(benchmark::State& state)
{
    PluginDelvixSrv plugin;
    auto worker = std::make_shared<AttributeQueryWorker>();
    worker->setTamsa(std::make_shared<MemoryStore>());
    auto retriever = QSharedPointer<AttributeRetriever>::create();
    retriever->setAttributeRetriever(worker);
    plugin.setAttributeRetriever(retriever);
    plugin.setCameraInformationCollector(QSharedPointer<FixedCollector>::create());
    plugin.InitialPluginBase(nullptr);
    const QVariantMap params{{KEY_LOC_ID_LIST, QStringList{QStringLiteral("Loc1")}}};
    // The work runs on the scheduler's thread: the process's processor time shows what it
    // cost when other programs share the machine, the wall time what a client waits.
    const std::clock_t cpuStart = std::clock();
    for (auto _ : state) {
        ReplyWaiter waiter;
        plugin.Request(CMD_START_SEARCH, params, benchSender(), waiter.callback());
        if (waiter.wait() != kHits) {
            state.SkipWithError("wrong hit count");
            break;
        }
    }
    const double cpuSeconds = double(std::clock() - cpuStart) / CLOCKS_PER_SEC;
    state.counters["per_hit"] = benchmark::Counter(kHits, benchmark::Counter::kIsIterationInvariantRate |
                                                              benchmark::Counter::kInvert);
    state.counters["cpu_per_hit_us"] =
        cpuSeconds * 1e6 / double(std::max<benchmark::IterationCount>(1, state.iterations()) * kHits);
}
BENCHMARK(BM_StartSearchInMemory)->Unit(benchmark::kMicrosecond)->UseRealTime();

// ---- seeded store ------------------------------------------------------------------------------

struct SeededStore
{
    QString dataDir;
    tamsa::TamsaSeedOptions options;
};
SeededStore g_seeded;

// Seeds DIR/Server once (a marker file names what it holds) and points the machine setting the
// plug-in reads at DIR, as the development host does.
bool prepareSeededStore()
{
    const QDir data(g_seeded.dataDir);
    if (!data.mkpath(QStringLiteral("Server")) || !data.mkpath(QStringLiteral("config"))) {
        return false;
    }
    QSettings::setPath(QSettings::NativeFormat, QSettings::SystemScope,
                       data.filePath(QStringLiteral("config")));
    QSettings settings(QSettings::NativeFormat, QSettings::SystemScope, QStringLiteral("Quorvex, Inc."),
                       QStringLiteral("NOVIR"));
    settings.setValue(QStringLiteral("Software/INSTALL_PATH"), QDir::toNativeSeparators(data.absolutePath()));
    settings.sync();

    const QByteArray marker = QByteArray::number(qulonglong(g_seeded.options.objects)) + ' ' +
                              QByteArray::number(g_seeded.options.locations) + ' ' +
                              QByteArray::number(g_seeded.options.seed);
    QFile markerFile(data.filePath(QStringLiteral("Server/seeded-by-bench")));
    if (markerFile.open(QIODevice::ReadOnly) && markerFile.readAll() == marker) {
        return true;
    }
    markerFile.close();
    std::fprintf(stderr, "seeding %llu objects in %u locations into %s ...\n",
                 static_cast<unsigned long long>(g_seeded.options.objects), g_seeded.options.locations,
                 qPrintable(data.filePath(QStringLiteral("Server"))));
    void* database = nullptr;
    const QByteArray record = TamsaWrapper::initRecord();
    Tamsa_InitDatabase(&database, record.constData(), 0);
    if (Tamsa_SetStoragesDBPath(database, data.filePath(QStringLiteral("Server")).toUtf8().constData()) !=
        0) {
        Tamsa_ReleaseDatabase(&database);
        return false;
    }
    const tamsa::TamsaSeeder seeder(g_seeded.options);
    uint64_t reported = 0;
    const tamsa::TamsaSeedReport report = seeder.seed(database, [&reported](uint64_t stored) {
        if (stored >= reported + 100000) {
            reported = stored;
            std::fprintf(stderr, "  %llu stored\n", static_cast<unsigned long long>(stored));
        }
    });
    Tamsa_ReleaseDatabase(&database);
    if (report.status != 0) {
        return false;
    }
    return markerFile.open(QIODevice::WriteOnly | QIODevice::Truncate) &&
           markerFile.write(marker) == marker.size();
}

QStringList allLocations()
{
    QStringList locations;
    for (uint32_t location = 1; location <= g_seeded.options.locations; ++location) {
        locations.append(QStringLiteral("Loc%1").arg(location));
    }
    return locations;
}

QVariantList asList(const std::vector<float>& vector)
{
    QVariantList list;
    list.reserve(qsizetype(vector.size()));
    for (float value : vector) {
        list.append(double(value));
    }
    return list;
}

void runSeeded(benchmark::State& state, const QString& command, const QVariantMap& params, int minimumHits)
{
    PluginDelvixSrv plugin;
    plugin.setCameraInformationCollector(QSharedPointer<FixedCollector>::create());
    plugin.InitialPluginBase(nullptr);
    int hits = 0;
    const std::clock_t cpuStart = std::clock();
    for (auto _ : state) {
        ReplyWaiter waiter;
        plugin.Request(command, params, benchSender(), waiter.callback());
        hits = waiter.wait();
        if (hits < minimumHits) {
            state.SkipWithError("too few hits: is the store seeded?");
            break;
        }
    }
    state.counters["hits"] = hits;
    // All threads of the process: the scheduler's, the pool's and the store's work.
    state.counters["cpu_ms"] = double(std::clock() - cpuStart) * 1000.0 / CLOCKS_PER_SEC /
                               double(std::max<benchmark::IterationCount>(1, state.iterations()));
}

// One location, a one-hour window in the middle of the seeded span, people of one gender. A store
// smaller than the targets' 1,000,000 objects gets a proportionally wider window (at most the whole
// span), so that the search still fills its 201 hits.
QVariantMap attributeSearch()
{
    const uint64_t objects = std::max<uint64_t>(1, g_seeded.options.objects);
    const qint64 window = qMin<qint64>(g_seeded.options.spanSeconds,
                                       3600 * qMax<qint64>(1, qint64((1000000 + objects - 1) / objects)));
    const qint64 start =
        (qint64(g_seeded.options.firstTime) + (g_seeded.options.spanSeconds - window) / 2) * 1000;
    return {{KEY_LOC_ID_LIST, QStringList{QStringLiteral("Loc7")}},
            {KEY_START_TIMESTAMP, start},
            {KEY_END_TIMESTAMP, start + window * 1000},
            {KEY_HUMAN_INFO, QStringLiteral(R"({"Gender":1})")}};
}

void BM_StartSearchSeeded(benchmark::State& state)
{
    runSeeded(state, CMD_START_SEARCH, attributeSearch(), kHits);
}

// The store's share of the same search: open, 201 records, close, without conversion or relay.
void BM_StoreOnlySeeded(benchmark::State& state)
{
    AttributeQueryWorker worker;
    const QVariantMap params = attributeSearch();
    TamsaImplement tamsa;
    int records = 0;
    for (auto _ : state) {
        void* database = nullptr;
        void* search = nullptr;
        records = 0;
        if (worker.getObjectMetaInfoFirst(params, &database, &search) == 0) {
            TTAMSA_OBJECTMETAINFO_RESULT result;
            std::memset(&result, 0, sizeof result);
            result.wSize = sizeof result;
            while (records < kHits && tamsa.GetObjectMetaInfoNext(search, &result) == 0) {
                ++records;
            }
            tamsa.GetObjectMetaInfoClose(search);
        }
        tamsa.releaseDatabase(&database);
    }
    state.counters["hits"] = records;
}

// Opening and releasing one connection to the store, which every location of a
// re-identification search pays.
void BM_OpenStoreSeeded(benchmark::State& state)
{
    TamsaImplement tamsa;
    for (auto _ : state) {
        void* database = nullptr;
        if (tamsa.initDatabase(&database) != 0) {
            state.SkipWithError("cannot open the store");
        }
        tamsa.releaseDatabase(&database);
    }
}

void BM_StartReIdSearchSeeded(benchmark::State& state)
{
    const tamsa::TamsaSeeder seeder(g_seeded.options);
    const uint32_t identity = 17 % seeder.identityCount();
    const qint64 start = qint64(g_seeded.options.firstTime) * 1000;
    const QVariantMap params{{KEY_LOC_ID_LIST, allLocations()},
                             {KEY_START_TIMESTAMP, start},
                             {KEY_END_TIMESTAMP, start + qint64(g_seeded.options.spanSeconds) * 1000},
                             {KEY_FEATURE, asList(seeder.identityBody(identity))},
                             {KEY_FACE_FEATURE, asList(seeder.identityFace(identity))}};
    // The store's float32 scan or its compact one (the plug-in loads the store into this process).
    ::setenv("TAMSA_SCAN", state.range(0) ? "compact" : "float32", 1);
    runSeeded(state, CMD_START_REID_SEARCH, params, 1);
    ::setenv("TAMSA_SCAN", "compact", 1);
}

} // namespace

int main(int argc, char** argv)
{
    QCoreApplication app(argc, argv);
    std::vector<char*> rest;
    for (int i = 0; i < argc; ++i) {
        const QByteArray argument(argv[i]);
        if (argument.startsWith("--seeded-store=")) {
            g_seeded.dataDir = QString::fromLocal8Bit(argument.mid(15));
        } else if (argument.startsWith("--seed-objects=")) {
            g_seeded.options.objects = argument.mid(15).toULongLong();
        } else if (argument.startsWith("--seed-locations=")) {
            g_seeded.options.locations = argument.mid(17).toUInt();
        } else {
            rest.push_back(argv[i]);
        }
    }
    if (!g_seeded.dataDir.isEmpty()) {
        if (g_seeded.options.objects == tamsa::TamsaSeedOptions().objects) {
            g_seeded.options.objects = 1000000;
        }
        if (g_seeded.options.locations == tamsa::TamsaSeedOptions().locations) {
            g_seeded.options.locations = 100;
        }
        if (!prepareSeededStore()) {
            std::fprintf(stderr, "bench_search: cannot prepare the seeded store in %s\n",
                         qPrintable(g_seeded.dataDir));
            return 1;
        }
        benchmark::RegisterBenchmark("BM_StartSearchSeeded", BM_StartSearchSeeded)
            ->Unit(benchmark::kMillisecond)
            ->UseRealTime();
        benchmark::RegisterBenchmark("BM_StoreOnlySeeded", BM_StoreOnlySeeded)
            ->Unit(benchmark::kMillisecond)
            ->UseRealTime();
        benchmark::RegisterBenchmark("BM_OpenStoreSeeded", BM_OpenStoreSeeded)
            ->Unit(benchmark::kMillisecond)
            ->UseRealTime();
        benchmark::RegisterBenchmark("BM_StartReIdSearchSeeded", BM_StartReIdSearchSeeded)
            ->ArgName("compact")
            ->Arg(0)
            ->Arg(1)
            ->Unit(benchmark::kMillisecond)
            ->UseRealTime();
    }
    bool repetitionsGiven = false;
    for (char* argument : rest) {
        repetitionsGiven = repetitionsGiven || std::strncmp(argument, "--benchmark_repetitions", 23) == 0;
    }
    static char defaultRepetitions[] = "--benchmark_repetitions=9";
    if (!repetitionsGiven) {
        rest.push_back(defaultRepetitions);
    }
    int restCount = int(rest.size());
    benchmark::Initialize(&restCount, rest.data());
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
