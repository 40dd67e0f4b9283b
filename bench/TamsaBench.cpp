// The object-metadata store against its performance targets:
//   - attribute query (one location, one hour, a gender and a colour condition): First + 201 records
//   - cosine scan against the memory read bandwidth measured in the same run (printed with the ratio),
//     and the compact (int8) scan against the float32 scan, in rows per second; fp16 for comparison
//   - feature search over every location's people, with and without the compact copy
//   - re-identification (body and face) over the last hour and over the whole span; the whole span
//     once on a cold page cache (the store's files evicted first), then warm
//   - ingest rate of camera answers; seeding time and disk size (the compact copy's share apart);
//     the memory the process holds at the end
//
// Environment:
//   TAMSA_BENCH_OBJECTS (default 20000), TAMSA_BENCH_LOCATIONS (default 10), TAMSA_BENCH_SEED (1):
//       what the store holds (and what the benchmark seeds when it makes its own store)
//   TAMSA_BENCH_SPAN_DAYS (default: the seeder's few hours): the time each location's objects span
//   TAMSA_BENCH_STORE=DIR: use (or make once) the store in DIR instead of a temporary folder; a store
//       made by `delvix-host seed --data D ...` is D/Server, seeded with the same three values.
//   TAMSA_BENCH_SCALE=1: the scale run (`./run bench-scale`): leaves out the scan-rate report and the
//       ingest benchmark, whose float32 passes over a store larger than memory would take hours.
#include "Tamsa.h"
#include "TamsaCosine.h"
#include "TamsaFeatureFile.h"
#include "TamsaSeeder.h"
#include "TamsaStore.h"

#include <benchmark/benchmark.h>

#include <QDir>
#include <QDirIterator>
#include <QElapsedTimer>
#include <QTemporaryDir>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cmath>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <immintrin.h>
#include <memory>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

tamsa::TamsaSeedOptions g_options;
std::string g_storePath;
std::unique_ptr<QTemporaryDir> g_tempDir;

uint64_t envNumber(const char* name, uint64_t fallback)
{
    const char* text = std::getenv(name);
    return text && *text ? std::strtoull(text, nullptr, 10) : fallback;
}

double seconds(std::chrono::steady_clock::duration duration)
{
    return std::chrono::duration<double>(duration).count();
}

void* openDatabase(const std::string& path)
{
    unsigned char record[704] = {0xC0, 0x02};
    void* database = nullptr;
    Tamsa_InitDatabase(&database, record, 0);
    if (Tamsa_SetStoragesDBPath(database, path.c_str()) != TAMSA_OK) {
        Tamsa_ReleaseDatabase(&database);
    }
    return database;
}

// Bytes of the files under `path` whose names end in `suffix` (all files for an empty one).
qint64 folderBytes(const QString& path, const QString& suffix = QString())
{
    qint64 total = 0;
    QDirIterator it(path, QDir::Files, QDirIterator::Subdirectories);
    while (it.hasNext()) {
        it.next();
        total += it.fileName().endsWith(suffix) ? it.fileInfo().size() : 0;
    }
    return total;
}

void reportDisk()
{
    const QString store = QString::fromStdString(g_storePath);
    const double f32 = double(folderBytes(store, ".f32")), rows = double(folderBytes(store, ".rows"));
    const double q8 = double(folderBytes(store, ".q8"));
    std::printf("disk: %.3f GB in all; float32 vectors %.3f GB, row records %.3f GB, compact copy %.3f GB "
                "= %.1f%% of the float32 files\n",
                double(folderBytes(store)) / 1e9, f32 / 1e9, rows / 1e9, q8 / 1e9, 100.0 * q8 / (f32 + rows));
}

// What this process holds, from /proc/self/status (file pages: the mapped store).
void reportMemory(const char* when)
{
    std::ifstream status("/proc/self/status");
    std::string name;
    double kB = 0, resident = 0, file = 0, peak = 0;
    while (status >> name) {
        if (name == "VmHWM:" || name == "VmRSS:" || name == "RssFile:") {
            status >> kB;
            (name == "VmHWM:" ? peak : name == "VmRSS:" ? resident : file) = kB / 1048576.0;
        }
    }
    std::printf(
        "memory held %s: resident %.2f GiB (store files mapped %.2f GiB, own %.2f GiB), peak %.2f GiB\n",
        when, resident, file, resident - file, peak);
    std::fflush(stdout);
}

bool prepareStore()
{
    g_options.objects = envNumber("TAMSA_BENCH_OBJECTS", 20000);
    g_options.locations = uint32_t(envNumber("TAMSA_BENCH_LOCATIONS", 10));
    g_options.seed = uint32_t(envNumber("TAMSA_BENCH_SEED", 1));
    g_options.spanSeconds = uint32_t(envNumber("TAMSA_BENCH_SPAN_DAYS", 0) * 86400);
    g_options.spanSeconds =
        g_options.spanSeconds ? g_options.spanSeconds : tamsa::TamsaSeedOptions().spanSeconds;
    if (const char* path = std::getenv("TAMSA_BENCH_STORE")) {
        g_storePath = path;
    } else {
        g_tempDir = std::make_unique<QTemporaryDir>();
        g_storePath = (g_tempDir->path() + "/Server").toStdString();
    }
    const bool existing = QFile::exists(QString::fromStdString(g_storePath + "/tamsa.db"));
    void* database = openDatabase(g_storePath);
    if (!database) {
        std::fprintf(stderr, "cannot open the store in %s\n", g_storePath.c_str());
        return false;
    }
    if (!existing) {
        const tamsa::TamsaSeeder seeder(g_options);
        const auto begin = std::chrono::steady_clock::now();
        const tamsa::TamsaSeedReport report = seeder.seed(database);
        const double took = seconds(std::chrono::steady_clock::now() - begin);
        std::printf("seeding: %llu objects (%llu people) over %u locations in %.1f s (%.0f objects/s); "
                    "store %.3f GB\n",
                    (unsigned long long)report.stored, (unsigned long long)report.people, g_options.locations,
                    took, double(report.stored) / took,
                    double(folderBytes(QString::fromStdString(g_storePath))) / 1e9);
    } else {
        std::printf("store: %s (%.3f GB), assumed seeded with %llu objects over %u locations, seed %u\n",
                    g_storePath.c_str(), double(folderBytes(QString::fromStdString(g_storePath))) / 1e9,
                    (unsigned long long)g_options.objects, g_options.locations, g_options.seed);
    }
    Tamsa_ReleaseDatabase(&database);
    reportDisk();
    return true;
}

// ---- memory bandwidth and the scan kernel ----------------------------------------------------

__attribute__((target("avx2"))) float sumFloats(const float* data, size_t count)
{
    __m256 a0 = _mm256_setzero_ps(), a1 = _mm256_setzero_ps(), a2 = _mm256_setzero_ps(),
           a3 = _mm256_setzero_ps();
    for (size_t i = 0; i + 32 <= count; i += 32) {
        a0 = _mm256_add_ps(a0, _mm256_load_ps(data + i));
        a1 = _mm256_add_ps(a1, _mm256_load_ps(data + i + 8));
        a2 = _mm256_add_ps(a2, _mm256_load_ps(data + i + 16));
        a3 = _mm256_add_ps(a3, _mm256_load_ps(data + i + 24));
    }
    alignas(32) float lanes[8];
    _mm256_store_ps(lanes, _mm256_add_ps(_mm256_add_ps(a0, a1), _mm256_add_ps(a2, a3)));
    float total = 0;
    for (float lane : lanes) {
        total += lane;
    }
    return total;
}

// One pass reading 1 GB with `threads` threads; GB/s.
double readBandwidth(unsigned threads)
{
    constexpr size_t bytes = size_t(1) << 30;
    static float* buffer = [] {
        auto* data = static_cast<float*>(std::aligned_alloc(64, bytes));
        for (size_t i = 0; i < bytes / sizeof(float); ++i) {
            data[i] = float(i & 1023);
        }
        return data;
    }();
    std::atomic<float> sink{0};
    const size_t perThread = bytes / sizeof(float) / threads;
    const auto begin = std::chrono::steady_clock::now();
    std::vector<std::thread> workers;
    for (unsigned t = 0; t < threads; ++t) {
        workers.emplace_back([&, t] { sink = sink + sumFloats(buffer + t * perThread, perThread); });
    }
    for (std::thread& worker : workers) {
        worker.join();
    }
    return double(bytes) / seconds(std::chrono::steady_clock::now() - begin) / 1e9;
}

struct ScanSet
{
    std::vector<std::shared_ptr<const tamsa::TamsaFeatureMap>> maps;
    size_t rows = 0;
};

ScanSet bodyMaps()
{
    int32_t status = 0;
    std::shared_ptr<tamsa::TamsaStore> store = tamsa::TamsaStore::open(g_storePath, &status);
    ScanSet set;
    for (uint32_t location = 1; store && location <= g_options.locations; ++location) {
        if (auto map = store->featureMap(location, tamsa::FeatureKind::Body)) {
            set.rows += size_t(map->rows());
            set.maps.push_back(map);
        }
    }
    return set;
}

// Cosine of one query against every stored body vector, as the search's scan does; GB/s.
double scanRate(const ScanSet& set, unsigned threads, tamsa::DotNormFn kernel, int passes = 1)
{
    const std::vector<float> query = tamsa::TamsaSeeder(g_options).identityBody(0);
    double best = 0;
    for (int pass = 0; pass < passes; ++pass) {
        std::atomic<size_t> nextMap{0};
        std::atomic<int> hits{0};
        const auto begin = std::chrono::steady_clock::now();
        std::vector<std::thread> workers;
        auto work = [&] {
            int found = 0;
            for (size_t m = nextMap++; m < set.maps.size(); m = nextMap++) {
                const tamsa::TamsaFeatureMap& map = *set.maps[m];
                for (int64_t row = 0; row < map.rows(); ++row) {
                    float dot = 0, norm2 = 0;
                    kernel(query.data(), map.vector(row), query.size(), &dot, &norm2);
                    found += tamsa::cosineFromParts(dot, 1.0f, norm2) >= 0.5f;
                }
            }
            hits += found;
        };
        for (unsigned t = 1; t < threads; ++t) {
            workers.emplace_back(work);
        }
        work();
        for (std::thread& worker : workers) {
            worker.join();
        }
        const double bytes = double(set.rows) * double(tamsa::kFeatureRowBytes);
        best = std::max(best, bytes / seconds(std::chrono::steady_clock::now() - begin) / 1e9);
    }
    return best;
}

// The compact scan as the search runs it: int8 scores rule rows out, the rest are scored in
// float32; rows per second. *float32Rows gets the rows that needed their float32 score.
double compactScanRate(const ScanSet& set, unsigned threads, int64_t* float32Rows)
{
    const std::vector<float> query = tamsa::TamsaSeeder(g_options).identityBody(0);
    tamsa::CompactQuery compact;
    tamsa::encodeCompactQuery(query, 0.5f, &compact);
    const tamsa::CompactFilterFn filter = tamsa::compactFilterBest();
    const tamsa::DotNormFn floatKernel = tamsa::dotNormBest();
    std::atomic<size_t> nextMap{0};
    std::atomic<int64_t> rescored{0};
    const auto begin = std::chrono::steady_clock::now();
    auto work = [&] {
        int64_t scored = 0;
        int found = 0;
        std::vector<uint32_t> kept(2048);
        for (size_t m = nextMap++; m < set.maps.size(); m = nextMap++) {
            const tamsa::TamsaFeatureMap& map = *set.maps[m];
            for (int64_t first = 0; first < map.compactRows(); first += 2048) {
                const size_t count =
                    filter(compact, &map.compact(first),
                           size_t(std::min<int64_t>(2048, map.compactRows() - first)), kept.data());
                for (size_t k = 0; k < count; ++k) {
                    float dot = 0, norm2 = 0;
                    floatKernel(query.data(), map.vector(first + kept[k]), query.size(), &dot, &norm2);
                    ++scored;
                    found += tamsa::cosineFromParts(dot, 1.0f, norm2) >= 0.5f;
                }
            }
        }
        benchmark::DoNotOptimize(found);
        rescored += scored;
    };
    std::vector<std::thread> workers;
    for (unsigned t = 1; t < threads; ++t) {
        workers.emplace_back(work);
    }
    work();
    for (std::thread& worker : workers) {
        worker.join();
    }
    *float32Rows = rescored;
    return double(set.rows) / seconds(std::chrono::steady_clock::now() - begin);
}

__attribute__((target("avx512f,f16c"))) float halfDot(const float* q, const uint16_t* h)
{
    __m512 a0 = _mm512_setzero_ps(), a1 = _mm512_setzero_ps();
    for (size_t i = 0; i < tamsa::kFeatureDim; i += 32) {
        _mm_prefetch(reinterpret_cast<const char*>(h + i) + 4096, _MM_HINT_T0);
        a0 = _mm512_fmadd_ps(
            _mm512_loadu_ps(q + i),
            _mm512_maskz_cvtph_ps(0xFFFF, _mm256_loadu_si256(reinterpret_cast<const __m256i*>(h + i))), a0);
        a1 = _mm512_fmadd_ps(
            _mm512_loadu_ps(q + i + 16),
            _mm512_maskz_cvtph_ps(0xFFFF, _mm256_loadu_si256(reinterpret_cast<const __m256i*>(h + i + 16))),
            a1);
    }
    alignas(64) float lanes[16];
    _mm512_store_ps(lanes, _mm512_add_ps(a0, a1));
    float dot = 0;
    for (float lane : lanes) {
        dot += lane;
    }
    return dot;
}

// The alternative copy measured against int8: fp16 rows (1024 bytes each), widened to float32
// and multiplied with a float query. Rows per second over `rows` rows (a copy made for this).
__attribute__((target("f16c"))) double halfScanRate(const ScanSet& set, size_t rows, unsigned threads)
{
    static std::vector<uint16_t> halves;
    const std::vector<float> query = tamsa::TamsaSeeder(g_options).identityBody(0);
    if (halves.size() != rows * tamsa::kFeatureDim) {
        halves.resize(rows * tamsa::kFeatureDim);
        size_t row = 0;
        for (size_t m = 0; m < set.maps.size() && row < rows; ++m) {
            for (int64_t r = 0; r < set.maps[m]->rows() && row < rows; ++r, ++row) {
                const float* vector = set.maps[m]->vector(r);
                for (size_t i = 0; i < tamsa::kFeatureDim; ++i) {
                    halves[row * tamsa::kFeatureDim + i] = _cvtss_sh(vector[i], 0);
                }
            }
        }
    }
    std::atomic<int> hits{0};
    const auto begin = std::chrono::steady_clock::now();
    auto work = [&](size_t first, size_t last) {
        int found = 0;
        for (size_t row = first; row < last; ++row) {
            found += halfDot(query.data(), halves.data() + row * tamsa::kFeatureDim) >= 0.5f;
        }
        hits += found;
    };
    std::vector<std::thread> workers;
    for (unsigned t = 1; t < threads; ++t) {
        workers.emplace_back(work, rows * t / threads, rows * (t + 1) / threads);
    }
    work(0, rows / threads);
    for (std::thread& worker : workers) {
        worker.join();
    }
    return double(rows) / seconds(std::chrono::steady_clock::now() - begin);
}

void reportCompactAgainstFloat(const ScanSet& set)
{
    const unsigned cores = std::max(1u, std::thread::hardware_concurrency());
    double floatRows = 0, compactRows = 0, halfRows = 0, int8Rows = 0;
    int64_t rescored = 0;
    ScanSet first; // the rows the fp16 copy holds (a few hundred MB), for int8 on the same rows
    for (size_t m = 0; m < set.maps.size() && first.rows < 300000; ++m) {
        first.maps.push_back(set.maps[m]);
        first.rows += size_t(set.maps[m]->rows());
    }
    const size_t sample = first.rows;
    for (int pass = 0; pass < 7; ++pass) {
        floatRows =
            std::max(floatRows, scanRate(set, cores, tamsa::dotNormBest()) * 1e9 / tamsa::kFeatureRowBytes);
        compactRows = std::max(compactRows, compactScanRate(set, cores, &rescored));
        halfRows = std::max(halfRows, halfScanRate(set, sample, cores));
        int64_t ignored = 0;
        int8Rows = std::max(int8Rows, compactScanRate(first, cores, &ignored));
    }
    std::printf("  %u thread(s): float32 scan %.1f M rows/s; compact scan (int8, kernel %s) %.1f M rows/s = "
                "%.2fx the float32 scan, %lld of %zu rows scored in float32 too\n",
                cores, floatRows / 1e6, tamsa::compactDotBestName(), compactRows / 1e6,
                compactRows / floatRows, (long long)rescored, set.rows);
    std::printf(
        "  copies compared on %zu rows: int8 %.1f M rows/s (528 bytes a row), fp16 %.1f M rows/s (1024 "
        "bytes a row) = %.2fx int8\n\n",
        first.rows, int8Rows / 1e6, halfRows / 1e6, halfRows / int8Rows);
    std::fflush(stdout);
}

void reportScanAgainstBandwidth()
{
    const ScanSet set = bodyMaps();
    const double vectorBytes = double(set.rows) * double(tamsa::kFeatureRowBytes);
    std::printf("\nscan set: %zu body vectors (%.0f MB) in %zu location files; kernel %s\n", set.rows,
                vectorBytes / 1e6, set.maps.size(), tamsa::dotNormBestName());
    if (vectorBytes < 256e6) {
        std::printf("  (note: under 256 MB the vectors may sit in the CPU cache; seed more objects for a "
                    "memory-bound figure)\n");
    }
    // Passes alternate between the two measurements so that both see the same machine load
    // (other processes share these cores); the best pass of each counts.
    const unsigned cores = std::max(1u, std::thread::hardware_concurrency());
    for (unsigned threads : {1u, cores}) {
        double bandwidth = 0;
        double simd = 0;
        for (int pass = 0; pass < 7; ++pass) {
            bandwidth = std::max(bandwidth, readBandwidth(threads));
            simd = std::max(simd, scanRate(set, threads, tamsa::dotNormBest()));
        }
        const double plain = scanRate(set, threads, tamsa::dotNormScalar(), 2);
        std::printf(
            "  %u thread(s): memory read %.1f GB/s; cosine scan %.1f GB/s = %.0f%% (plain loop %.1f GB/s "
            "= %.0f%%)\n",
            threads, bandwidth, simd, 100.0 * simd / bandwidth, plain, 100.0 * plain / bandwidth);
        if (threads == cores) {
            break;
        }
    }
    reportCompactAgainstFloat(set);
}

// ---- searches ---------------------------------------------------------------------------------

struct Search
{
    TTAMSA_OBJECTMETAINFO_QUERY query;
    std::vector<uint32_t> locations;
    std::string primary, other, feature, face;
};

// Opens, reads up to `limit` records and closes; returns the number read.
int runSearch(void* database, const TTAMSA_OBJECTMETAINFO_QUERY& query, int limit)
{
    void* search = nullptr;
    if (Tamsa_GetObjectMetaInfoFirst(database, &query, &search) != TAMSA_OK) {
        return -1;
    }
    TTAMSA_OBJECTMETAINFO_RESULT result{};
    result.wSize = sizeof result;
    int count = 0;
    while (count < limit && Tamsa_GetObjectMetaInfoNext(search, &result) == TAMSA_OK) {
        benchmark::DoNotOptimize(result.pszThumbnails);
        ++count;
    }
    Tamsa_GetObjectMetaInfoClose(search);
    return count;
}

void BM_AttributeQueryFirst201(benchmark::State& state)
{
    void* database = openDatabase(g_storePath);
    Search s;
    std::memset(&s.query, 0, sizeof s.query);
    s.query.wSize = sizeof s.query;
    // An hour at the targets' size (2,500 objects an hour in a location); a store whose locations
    // see fewer an hour (the scale run's 30 days) gets as many hours as hold that many.
    const double perHour = double(g_options.objects) / std::max(1u, g_options.locations) * 3600.0 /
                           std::max(1u, g_options.spanSeconds);
    const uint32_t hours = uint32_t(std::max(1.0, std::ceil(2500.0 / std::max(1.0, perHour))));
    s.query.dwStartTime = g_options.firstTime + 3600;
    s.query.dwEndTime = g_options.firstTime + 3600 * (1 + hours);
    s.locations = {1, 0};
    s.query.pdwLocationIds = s.locations.data();
    s.query.pszObjectType = "Human";
    s.primary = R"({"Gender":1})";
    s.other = R"({"UpperColor":[2,4,5]})";
    s.query.pszPrimaryAttributes = s.primary.c_str();
    s.query.pszOtherAttributes = s.other.c_str();
    int records = 0;
    for (auto _ : state) {
        records = runSearch(database, s.query, 201);
    }
    state.counters["records"] = records;
    Tamsa_ReleaseDatabase(&database);
}

std::string vectorText(const std::vector<float>& vector)
{
    std::string out = "[";
    char buffer[32];
    for (size_t i = 0; i < vector.size(); ++i) {
        out += (i ? "," : "") +
               std::string(buffer, size_t(std::snprintf(buffer, sizeof buffer, "%.7g", vector[i])));
    }
    return out + "]";
}

// A feature search over every location: people by body (and face), in [start, end].
struct FeatureSearch : Search
{
    FeatureSearch(bool withFace, uint32_t start, uint32_t end)
    {
        const tamsa::TamsaSeeder seeder(g_options);
        std::memset(&query, 0, sizeof query);
        query.wSize = sizeof query;
        query.dwStartTime = start;
        query.dwEndTime = end;
        for (uint32_t location = 1; location <= g_options.locations; ++location) {
            locations.push_back(location);
        }
        locations.push_back(0);
        query.pdwLocationIds = locations.data();
        query.pszObjectType = "Human";
        feature = vectorText(seeder.identityBody(7));
        query.pszFeature = feature.c_str();
        if (withFace) {
            face = vectorText(seeder.identityFace(7));
            query.pszFaceFeature = face.c_str();
        }
    }
};

// The float32 scan or the compact one, for the searches that follow.
void useCompactScan(bool compact)
{
    ::setenv("TAMSA_SCAN", compact ? "compact" : "float32", 1);
}

void runFeatureSearch(benchmark::State& state, const FeatureSearch& s)
{
    void* database = openDatabase(g_storePath);
    useCompactScan(state.range(1) == 1);
    int records = 0;
    for (auto _ : state) {
        records = runSearch(database, s.query, 1 << 30);
    }
    state.counters["records"] = records;
    useCompactScan(true);
    Tamsa_ReleaseDatabase(&database);
}

void BM_FeatureSearchAllLocations(benchmark::State& state)
{
    runFeatureSearch(state, FeatureSearch(state.range(0) == 1, 0, 0xFFFFFFFFu));
    state.counters["people"] = double(bodyMaps().rows);
}

// Re-identification (body and face) over the last hour of the seeded span, or over all of it.
void BM_ReIdWindow(benchmark::State& state)
{
    const uint32_t end = g_options.firstTime + g_options.spanSeconds;
    runFeatureSearch(state, FeatureSearch(true, state.range(0) ? end - 3600 : g_options.firstTime, end));
}

// The whole span once with the store's files evicted from the page cache (as after a restart
// or when the store outgrew memory), before anything maps them; then warm. Milliseconds.
void reportColdSearch()
{
    ::sync(); // dirty pages cannot be evicted
    QDirIterator it(QString::fromStdString(g_storePath), QDir::Files, QDirIterator::Subdirectories);
    while (it.hasNext()) {
        const int fd = ::open(it.next().toLocal8Bit().constData(), O_RDONLY | O_CLOEXEC);
        if (fd >= 0) {
            ::posix_fadvise(fd, 0, 0, POSIX_FADV_DONTNEED);
            ::close(fd);
        }
    }
    const FeatureSearch s(true, g_options.firstTime, g_options.firstTime + g_options.spanSeconds);
    void* database = openDatabase(g_storePath);
    std::vector<double> took;
    int records = 0;
    for (int run = 0; run < 6; ++run) {
        const auto begin = std::chrono::steady_clock::now();
        records = runSearch(database, s.query, 1 << 30);
        took.push_back(seconds(std::chrono::steady_clock::now() - begin) * 1e3);
    }
    Tamsa_ReleaseDatabase(&database);
    std::sort(took.begin() + 1, took.end());
    std::printf(
        "re-identification over the whole span, every location: cold page cache %.0f ms, warm %.1f ms "
        "(median of 5); %d records\n",
        took[0], took[3], records);
    reportMemory("after the first searches");
}

void BM_Ingest(benchmark::State& state)
{
    // A fresh store per run, fed the answers of a small seeding (generated before timing).
    tamsa::TamsaSeedOptions options;
    options.objects = 10000;
    options.locations = 5;
    options.seed = 99;
    const tamsa::TamsaSeeder seeder(options);
    std::vector<std::pair<uint32_t, std::string>> answers;
    for (uint32_t location = 1; location <= options.locations; ++location) {
        for (uint64_t first = 0; first < seeder.objectsAt(location); first += options.batchSize) {
            answers.emplace_back(location, seeder.answer(location, first, options.batchSize));
        }
    }
    // The seeding before this leaves gigabytes of dirty pages whose write-back would compete
    // with the measured ingest.
    ::sync();
    uint64_t stored = 0;
    double bytes = 0;
    double wall = 0;
    for (auto _ : state) {
        state.PauseTiming();
        QTemporaryDir dir;
        void* database = openDatabase((dir.path() + "/Server").toStdString());
        state.ResumeTiming();
        const auto begin = std::chrono::steady_clock::now();
        for (const auto& answer : answers) {
            stored += uint64_t(std::max(
                0, Tamsa_PutObjectMetaInfo(database, 1, int32_t(answer.first), answer.second.c_str())));
            bytes += double(answer.second.size());
        }
        wall += seconds(std::chrono::steady_clock::now() - begin);
        state.PauseTiming();
        Tamsa_ReleaseDatabase(&database);
        state.ResumeTiming();
    }
    // Per CPU second of this thread, and per wall-clock second (they differ on a busy machine).
    state.counters["objects/s"] = benchmark::Counter(double(stored), benchmark::Counter::kIsRate);
    state.counters["objects/s_wall"] = double(stored) / wall;
    state.SetBytesProcessed(int64_t(bytes));
}

} // namespace

int main(int argc, char** argv)
{
    if (!prepareStore()) {
        return 1;
    }
    const bool scale = envNumber("TAMSA_BENCH_SCALE", 0) != 0;
    reportColdSearch();
    if (!scale) {
        reportScanAgainstBandwidth();
    }
    benchmark::RegisterBenchmark("BM_AttributeQueryFirst201", BM_AttributeQueryFirst201)
        ->Unit(benchmark::kMillisecond)
        ->Repetitions(15)
        ->ReportAggregatesOnly(true);
    // float32 and compact alternate, so that both see the same machine load.
    benchmark::RegisterBenchmark("BM_FeatureSearchAllLocations", BM_FeatureSearchAllLocations)
        ->ArgNames({"withFace", "compact"})
        ->ArgsProduct({{0, 1}, {0, 1}})
        ->Unit(benchmark::kMillisecond)
        ->Repetitions(7)
        ->ReportAggregatesOnly(true);
    benchmark::RegisterBenchmark("BM_ReIdWindow", BM_ReIdWindow)
        ->ArgNames({"lastHour", "compact"})
        ->ArgsProduct({{1, 0}, {0, 1}})
        ->Unit(benchmark::kMillisecond)
        ->Repetitions(7)
        ->ReportAggregatesOnly(true);
    if (!scale) {
        benchmark::RegisterBenchmark("BM_Ingest", BM_Ingest)
            ->Unit(benchmark::kMillisecond)
            ->Iterations(2)
            ->Repetitions(5)
            ->ReportAggregatesOnly(true);
    }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    reportMemory("at the end");
    return 0;
}
