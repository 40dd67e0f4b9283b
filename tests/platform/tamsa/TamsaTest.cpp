// The object-metadata store. Which objects a search returns, and in which order: one table over a few
// hand-made objects, then the scores of feature searches and the result record itself. Ingest,
// durability, and the thread rules: Abort from another thread, handles used at once. Then a storage
// directory that is read-only or full: ingest fails with a status and stores nothing half-way,
// searches keep answering from what is there, and once the directory is writable (or has room) again
// the same handle ingests as before, with nothing acknowledged earlier lost. Each fault lives in a
// forked child, so that its mounts and file-size limit end with it.
#include "Faults.h"
#include "StoreFixture.h"
#include "TamsaCosine.h"
#include "TamsaSearch.h"
#include "TamsaSeeder.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <functional>
#include <numeric>
#include <sys/mount.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

using namespace storetest;

namespace {

using TamsaMatchingTest = StoreFixture;
using Q = QueryOptions;

QueryOptions at(std::vector<uint32_t> locations, const std::string& primary = "", uint32_t featureOf = 0)
{
    QueryOptions options;
    options.locations = std::move(locations);
    options.primary = primary;
    options.feature = featureOf ? jsonArray(randomUnitVector(featureOf)) : std::string();
    return options;
}

TEST_F(TamsaMatchingTest, QueriesSelectAndOrderTheRightObjects)
{
    // The walker crosses x = 0.5 from the positive side, entering the zone only between points; the
    // returner stays long and crosses the other way above the zone; the van's plate is known only
    // from its plate crop, and it passes beyond the line's end.
    const std::string adult = R"({"Age":"Adult","Gender":1,"UpperColor":[2,5],"Accessories":[]})";
    ObjectSpec loiterer{5}; // 11 points over 10 s, points 2..7 inside the zone: a stay of 5 s
    for (int i = 0; i <= 10; ++i) {
        loiterer.trajectory.push_back({i >= 2 && i <= 7 ? 0.55 : 0.7, 0.5});
    }
    ASSERT_EQ(
        put(1, {{1, "Human", 100, 200, adult, {{0.1, 0.5}, {0.3, 0.5}, {0.9, 0.5}}},
                {2, "Human", 5000, 9000, R"({"Gender":0})", {{0.9, 0.7}, {0.2, 0.7}}},
                {3, "Vehicle", 300, 310, R"({"Type":3,"PlateNumber":"ABC-1234"})", {{0.1, 0.1}, {0.4, 0.9}}},
                {4, "Vehicle", 400, 410, "{}", {{0.1, 1.5}, {0.9, 1.5}}, {}, {}, false, "xyz 999"},
                loiterer}),
        5);
    ASSERT_EQ(put(3, {{6, "Human", 150, 160}}), 1);

    const std::string line = "[[0.5,0],[0.5,1]]";
    const std::string zone = R"([{"x":0.4,"y":0.4},{"x":0.6,"y":0.4},{"x":0.6,"y":0.6},{"x":0.4,"y":0.6}])";
    const int32_t bad = TAMSA_E_BAD_QUERY;
    struct Case
    {
        const char* name;
        std::function<void(Q&)> edit;
        Ids expected; // in this order, unless the query asks for no sorting
        int32_t status = TAMSA_E_NO_MORE_RECORDS;
    };
    // clang-format off
    const Case cases[] = {
        {"all, by start time", [](Q&) {}, {1, 3, 4, 5, 2}},
        {"descending", [](Q& q) { q.descending = true; }, {2, 5, 4, 3, 1}},
        {"unsorted", [](Q& q) { q.doNotSort = q.descending = true; }, {1, 2, 3, 4, 5}},
        {"window from an end", [](Q& q) { q.start = 200, q.end = 300; }, {1, 3}},
        {"window up to a start", [](Q& q) { q.start = 50, q.end = 100; }, {1}},
        {"window inside a stay", [](Q& q) { q.start = 6000, q.end = 6001; }, {2}},
        {"inverted window", [](Q& q) { q.start = 300, q.end = 100; }, {}},
        {"locations merged, repeats once", [](Q& q) { q.locations = {1, 3, 1}; }, {1, 6, 3, 4, 5, 2}},
        {"no location list", [](Q& q) { q.nullLocations = true; }, {}},
        {"type", [](Q& q) { q.type = "Vehicle"; }, {3, 4}},
        {"lists share a value", [](Q& q) { q.primary = R"({"UpperColor":[5,7]})"; }, {1}},
        {"scalar in a list", [](Q& q) { q.primary = R"({"UpperColor":2})"; }, {1}},
        {"list holds the scalar", [](Q& q) { q.primary = R"({"Gender":[0,1]})"; }, {1, 2}},
        {"numbers by value", [](Q& q) { q.primary = R"({"Gender":1.0})"; }, {1}},
        {"a text is no number", [](Q& q) { q.primary = R"({"Gender":"1"})"; }, {}},
        {"texts ignore case", [](Q& q) { q.primary = R"({"Age":"aDULT"})"; }, {1}},
        {"missing attribute", [](Q& q) { q.primary = R"({"Hat":1})"; }, {}},
        {"empty list", [](Q& q) { q.primary = R"({"Accessories":[]})"; }, {}},
        {"primary and other", [](Q& q) { q.primary = R"({"Gender":1})", q.other = R"({"UpperColor":[5]})"; }, {1}},
        {"attributes not an object", [](Q& q) { q.primary = "[1]"; }, {}, bad},
        {"plate contained", [](Q& q) { q.plate = "c-12"; }, {3}},
        {"plate star", [](Q& q) { q.plate = "a*4"; }, {3}},
        {"plate question mark", [](Q& q) { q.plate = "A?C"; }, {3}},
        {"plate from the crop", [](Q& q) { q.plate = "Z 99"; }, {4}},
        {"any plate", [](Q& q) { q.plate = "*"; }, {3, 4}},
        {"any plate, as an attribute", [](Q& q) { q.primary = R"({"PlateNumber":"**"})"; }, {3, 4}},
        {"plate and type", [](Q& q) { q.primary = R"({"PlateNumber":"bc-1","Type":3})"; }, {3}},
        {"line either way", [&](Q& q) { q.trace = line; }, {1, 2}},
        {"line positive to negative", [&](Q& q) { q.trace = line, q.direction = 2; }, {1}},
        {"line negative to positive", [&](Q& q) { q.trace = line, q.direction = 1; }, {2}},
        {"unknown direction", [&](Q& q) { q.trace = line, q.direction = 5; }, {}, bad},
        {"one-point trace", [](Q& q) { q.trace = "[[0.5,0.5]]"; }, {}, bad},
        {"endless point", [](Q& q) { q.trace = "[[1e999,0],[0.5,1]]"; }, {}, bad},
        {"feature cut short", [](Q& q) { q.feature = "[1,2"; }, {}, bad},
        {"zone entered", [&](Q& q) { q.trace = zone; }, {1, 5}},
        {"loitering long enough", [&](Q& q) { q.trace = zone, q.loitering = true, q.duration = 5; }, {5}},
        {"loitering too short", [&](Q& q) { q.trace = zone, q.loitering = true, q.duration = 6; }, {}},
    };
    // clang-format on
    for (const Case& c : cases) {
        Q options;
        c.edit(options);
        int32_t status = 0;
        Ids ids = idsOf(search(options, &status));
        std::sort(ids.begin(), options.doNotSort ? ids.end() : ids.begin());
        EXPECT_EQ(std::pair(status, ids), std::pair(c.status, c.expected)) << c.name;
    }
}

TEST_F(TamsaMatchingTest, FeatureScoresThresholdAndOrder)
{
    const auto scored = [](uint64_t id, float score, float faceScore) {
        return QString::asprintf("%llu:%.4f:%.4f ", qulonglong(id), score, faceScore).toStdString();
    };
    const std::vector<float> identity = randomUnitVector(1), faceIdentity = randomUnitVector(2);
    const std::vector<float> closeBody = noisyCopy(identity, 0.3f, 10),
                             farBody = noisyCopy(identity, 1.0f, 11);
    // The fourth has a stranger's body with the identity's face.
    const std::vector<float> body4 = randomUnitVector(14), face4 = noisyCopy(faceIdentity, 0.2f, 15);
    ASSERT_EQ(put(1, {{1, "Human", 1000, 1010, "{}", {}, closeBody},
                      {2, "Human", 1000, 1010, "{}", {}, farBody},
                      {3, "Human", 1000, 1010, "{}", {}, randomUnitVector(12), randomUnitVector(13)},
                      {4, "Human", 1000, 1010, "{}", {}, body4, face4},
                      {5, "Vehicle"}}),
              5);
    // Best first, strangers below the threshold left out; with a face vector the better of the two
    // scores orders, and both are filled.
    Q options = at({1}, "", 1); // the identity's body
    std::string got;
    for (const ResultCopy& r : search(options)) {
        got += scored(r.id, r.score, r.faceScore);
    }
    EXPECT_EQ(got,
              scored(1, plainCosine(identity, closeBody), 0) + scored(2, plainCosine(identity, farBody), 0));
    options.faceFeature = jsonArray(faceIdentity);
    const std::vector<ResultCopy> both = search(options);
    ASSERT_EQ(both.size(), 3u);
    EXPECT_EQ(scored(both[0].id, both[0].score, both[0].faceScore),
              scored(4, plainCosine(identity, body4), plainCosine(faceIdentity, face4)));
    EXPECT_GE(std::max(both[1].score, both[1].faceScore), std::max(both[2].score, both[2].faceScore));

    // The vector kernel in use and the plain loop agree, also on lengths that leave a tail.
    for (size_t n : {kDim, kDim - 5, size_t(3)}) {
        float parts[4] = {};
        tamsa::dotNormScalar()(identity.data(), closeBody.data(), n, &parts[0], &parts[1]);
        tamsa::dotNormBest()(identity.data(), closeBody.data(), n, &parts[2], &parts[3]);
        EXPECT_NEAR(parts[0], parts[2], 1e-5) << tamsa::dotNormBestName() << " n=" << n;
        EXPECT_NEAR(parts[1], parts[3], 1e-4) << tamsa::dotNormBestName() << " n=" << n;
    }
}

TEST_F(TamsaMatchingTest, ResultRecordCarriesEverythingStored)
{
    ObjectSpec person{~0ull, "Human", 1000, 1010,
                      R"({"Gender":1,"UpperColor":[2,5],"Name":"\ud800\udc00 \u00e9 \"\\\/\n\u001f"})"};
    person.trajectory = {{0.25, 0.5}, {0.75, 0.125}};
    person.body = randomUnitVector(3), person.face = randomUnitVector(4), person.faceFiltered = true;
    ASSERT_EQ(put(9, {person}), 1);
    const std::vector<ResultCopy> results = search(at({9}));
    ASSERT_EQ(results.size(), 1u);
    const ResultCopy& r = results[0];
    const auto json = [](const std::string& text) {
        return QJsonDocument::fromJson(QByteArray::fromStdString(text));
    };
    const QJsonObject body = json(r.thumbnails)["Thumbnail"][0].toObject();
    const QJsonObject face = json(r.thumbnails)["FaceThumbnail"][0].toObject();
    std::vector<float> features;
    for (const QVariant& value :
         body["feature"].toArray().toVariantList() + face["feature"].toArray().toVariantList()) {
        features.push_back(value.toFloat());
    }
    EXPECT_EQ(QString::asprintf("%llu %u %s %u-%u %s %d", qulonglong(r.id), r.location, r.type.c_str(),
                                r.start, r.end, qPrintable(body["image"].toString()),
                                face["face_detection_info"]["filtered"].toInt())
                  .toStdString(),
              "18446744073709551615 9 Human 1000-1010 aW1hZ2U18446744073709551615 1");
    EXPECT_EQ(r.trajectory, (std::vector<double>{0.25, 0.5, 0.75, 0.125}));
    EXPECT_EQ(json(r.attributes), json(person.attributes));
    person.body.insert(person.body.end(), person.face.begin(), person.face.end());
    EXPECT_EQ(features, person.body);
}

using TamsaLifecycleTest = StoreFixture;

TEST_F(TamsaLifecycleTest, ReingestReplacesWithoutDuplicates)
{
    ASSERT_EQ(put(1, {{42, "Human", 1000, 1010, R"({"Gender":0})", {}, randomUnitVector(1)}}), 1);
    const ObjectSpec object{42, "Human", 1000, 1010, R"({"Gender":1})", {}, randomUnitVector(2)};
    ASSERT_EQ(put(1, {object}), 1);
    ASSERT_EQ(put(2, {object}), 1) << "the key is (location, ID)";
    // The replaced attributes and vector are no longer searched; the same ID twice in one answer: the
    // later one wins.
    ASSERT_EQ(put(3, {{7, "Human", 1, 2, R"({"Age":"Young"})"}, {7, "Human", 1, 2, R"({"Age":"Old"})"}}), 1);
    EXPECT_EQ((std::vector<Ids>{searchIds(at({1}, R"({"Gender":1})")), searchIds(at({1}, R"({"Gender":0})")),
                                searchIds(at({1}, "", 1)), searchIds(at({1, 2}, "", 2)),
                                searchIds(at({3}, R"({"Age":"Old"})"))}),
              (std::vector<Ids>{{42}, {}, {}, {42, 42}, {7}}));
}

TEST_F(TamsaLifecycleTest, BadIngestInputIsRefusedOrSkipped)
{
    const std::string deep = std::string(100, '[') + std::string(100, ']'); // beyond the store's 64
    for (const std::string& text :
         {std::string("not json"), std::string("[]"), std::string(R"({"ObjectMetaInfo":{}})"), deep}) {
        EXPECT_EQ(putText(1, text), TAMSA_E_BAD_JSON) << text.substr(0, 20);
    }
    EXPECT_EQ(putText(0, R"({"ObjectMetaInfo":[]})"), TAMSA_E_INVALID_ARGUMENT);

    std::string shortFeature = objectJson({50}); // a 3-number feature
    shortFeature.replace(shortFeature.find("\"image\""), 0, "\"feature\":[1,2,3],");
    // No ID, ID as text, a negative ID, times out of range, an end before the start, attributes that
    // are no object, a short feature: only the good element is stored.
    std::string answer = R"({"ObjectMetaInfo":[)" + objectJson({5}) + ",null," + shortFeature;
    for (const char* fields :
         {R"("StartTime":1,"EndTime":2)", R"("ID":"9","StartTime":1,"EndTime":2)",
          R"("ID":-9,"StartTime":1,"EndTime":2)", R"("ID":9,"StartTime":1e300,"EndTime":1e301)",
          R"("ID":9,"StartTime":5,"EndTime":2)", R"("ID":9,"StartTime":1,"EndTime":2,"Attributes":[1])"}) {
        answer += std::string(R"(,{"ObjectType":"Human",)") + fields + "}";
    }
    EXPECT_EQ(putText(1, answer + "]}"), 1);
    // Nesting beyond what any camera sends makes the whole text unreadable: nothing is stored.
    EXPECT_EQ(put(1, {{8}, {9, "Human", 1, 2, "{\"a\":" + deep + "}"}}), TAMSA_E_BAD_JSON);
    EXPECT_EQ(searchIds(QueryOptions()), Ids{5});
}

TEST_F(TamsaLifecycleTest, StoredObjectsSurviveReopeningAndAKilledProcess)
{
    ASSERT_EQ(put(1, numberedObjects(11, 1)), 1);
    Tamsa_ReleaseDatabase(&m_database);
    // A child process stores an object and is killed at once, without any clean-up.
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        void* database = openHandle();
        if (Tamsa_PutObjectMetaInfo(database, 1, 1, answerJson(numberedObjects(12, 1)).c_str()) == 1) {
            ::kill(::getpid(), SIGKILL);
        }
        ::_exit(3);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFSIGNALED(status)) << "the child's ingest failed";

    // A writer killed half-way through a row leaves a torn tail in the vector files: the next
    // ingest cuts it off and appends whole rows after the last whole one.
    for (const char* file : {"/features/L1.body.f32", "/features/L1.body.rows"}) {
        std::ofstream(storagePath() + file, std::ios::app | std::ios::binary) << "torn row";
    }
    m_database = openHandle();
    ASSERT_EQ(put(1, numberedObjects(13, 1)), 1);
    EXPECT_EQ(searchIds(QueryOptions()), (Ids{11, 12, 13}));
    for (uint32_t id : {11, 12, 13}) {
        const std::vector<ResultCopy> hits = search(at({1}, "", id));
        EXPECT_TRUE(idsOf(hits) == Ids{id} && hits[0].score > 0.999f) << id;
    }
}

// Abort from another thread: a Next that starts after Abort returned never delivers a record, the
// search ends with the abort code, and every later Next says so too; during a feature scan Abort
// lands at some point of it (or just before it).
TEST_F(TamsaLifecycleTest, AbortFromAnotherThreadEndsTheSearch)
{
    ASSERT_EQ(put(1, numberedObjects(1, 3000, false)), 3000);
    for (uint32_t location = 2; location <= 4; ++location) {
        ASSERT_EQ(put(location, numberedObjects(location * 10000, 2000)), 2000);
    }
    std::vector<uint32_t> locations;
    const TTAMSA_OBJECTMETAINFO_QUERY plain = makeQuery(QueryOptions(), &locations);
    void* search = nullptr;
    ASSERT_EQ(Tamsa_GetObjectMetaInfoFirst(m_database, &plain, &search), TAMSA_OK);
    TTAMSA_OBJECTMETAINFO_RESULT record{};
    record.wSize = sizeof record;
    std::atomic<bool> abortCalled{false}, abortReturned{false};
    std::thread aborter([&]() {
        abortCalled = true;
        Tamsa_GetObjectMetaInfoAbort(search);
        abortReturned = true;
    });
    int32_t status = TAMSA_OK;
    int lateRecords = 0;
    for (bool afterAbort = false; (status = Tamsa_GetObjectMetaInfoNext(search, &record)) == TAMSA_OK;
         afterAbort = abortReturned) {
        lateRecords += afterAbort;
        while (!abortCalled) { // the search must not run out before Abort is called
            std::this_thread::yield();
        }
        std::this_thread::sleep_for(std::chrono::microseconds(500)); // a slow consumer
    }
    aborter.join();
    EXPECT_EQ(std::pair(status, lateRecords), std::pair(TAMSA_E_ABORTED, 0)) << "records after Abort";
    EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(search, &record), TAMSA_E_ABORTED) << "and stays ended";
    Tamsa_GetObjectMetaInfoClose(search);

    const QueryOptions options = at({2, 3, 4}, "", 20005);
    const TTAMSA_OBJECTMETAINFO_QUERY scan = makeQuery(options, &locations); // points into options
    for (int delayMicroseconds : {0, 100, 300, 1000}) {
        ASSERT_EQ(Tamsa_GetObjectMetaInfoFirst(m_database, &scan, &search), TAMSA_OK);
        std::thread aborter([&]() {
            std::this_thread::sleep_for(std::chrono::microseconds(delayMicroseconds));
            Tamsa_GetObjectMetaInfoAbort(search);
        });
        for (int count = 0;
             count < 10 && (status = Tamsa_GetObjectMetaInfoNext(search, &record)) == TAMSA_OK;) {
            ++count;
        }
        aborter.join();
        EXPECT_TRUE(status == TAMSA_E_ABORTED || status == TAMSA_E_NO_MORE_RECORDS) << status;
        EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(search, &record), TAMSA_E_ABORTED);
        Tamsa_GetObjectMetaInfoClose(search);
    }
}

TEST_F(TamsaLifecycleTest, HandlesSearchAndIngestOnSeveralThreadsAtOnce)
{
    ASSERT_EQ(put(1, numberedObjects(1, 400)), 400);
    ASSERT_EQ(put(2, numberedObjects(1001, 400)), 400);
    const QueryOptions plain = at({1, 2}, R"({"Gender":1})"), feature = at({1, 2}, "", 1100);
    const Ids expectedPlain = searchIds(plain);
    ASSERT_EQ(expectedPlain.size(), 400u);
    std::atomic<int> mismatches{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) { // three search, one keeps ingesting into a third location
        threads.emplace_back([&, t]() {
            void* handle = openHandle();
            for (int round = 0; round < 15; ++round) {
                int32_t status = 0;
                if (t == 3 && round < 10) {
                    const std::string answer = answerJson(numberedObjects(5000 + round * 10, 10));
                    mismatches += Tamsa_PutObjectMetaInfo(handle, 1, 3, answer.c_str()) != 10;
                } else if (t < 3) {
                    const Ids ids = idsOf(searchStore(handle, t % 2 ? feature : plain, &status));
                    mismatches +=
                        status != TAMSA_E_NO_MORE_RECORDS || ids != (t % 2 ? Ids{1100} : expectedPlain);
                }
            }
            Tamsa_ReleaseDatabase(&handle);
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(mismatches.load(), 0);
    EXPECT_EQ(searchIds(at({3})).size(), 100u);
    // Vectors ingested after a search mapped the files are found by the next search.
    EXPECT_EQ(searchIds(at({3}, "", 5099)), Ids{5099});
    ASSERT_EQ(put(3, numberedObjects(7000, 5)), 5);
    EXPECT_EQ(searchIds(at({3}, "", 7004)), Ids{7004});
}

using TamsaStorageFaultTest = StoreFixture;

// Stores objects firstId.. (count of them) and, when it worked, adds them to *acknowledged.
int32_t putOn(void* database, uint64_t firstId, size_t count, Ids* acknowledged = nullptr)
{
    const int32_t result =
        Tamsa_PutObjectMetaInfo(database, 7, 1, answerJson(numberedObjects(firstId, count)).c_str());
    for (uint64_t id = firstId; acknowledged && result > 0 && id < firstId + count; ++id) {
        acknowledged->push_back(id);
    }
    return result;
}

// Every stored object comes back whole: the plain search returns exactly `expected` (in id order,
// as their start times go) with their own attributes and thumbnails, and a sample of them is found
// first by its own body vector. A null `database` opens `directory` afresh for the check.
void expectStored(void* database, const Ids& expected, const std::string& directory = "")
{
    void* fresh = database ? nullptr : openStore(directory);
    void* handle = database ? database : fresh;
    ASSERT_NE(handle, nullptr);
    QueryOptions options;
    std::string got, want;
    for (const ResultCopy& r : searchStore(handle, options)) {
        got += std::to_string(r.id) + r.attributes +
               (r.thumbnails.find("null") == std::string::npos ? "" : "null");
    }
    for (uint64_t id : expected) {
        want += std::to_string(id) + numberedObjects(id, 1)[0].attributes;
        if (id % 7 == 0 || id == expected.back()) { // a sample keeps the scans few
            options.feature = jsonArray(randomUnitVector(uint32_t(id)));
            const std::vector<ResultCopy> hits = searchStore(handle, options);
            EXPECT_TRUE(!hits.empty() && hits[0].id == id && hits[0].score > 0.999f) << "object " << id;
        }
    }
    EXPECT_EQ(got, want);
    Tamsa_ReleaseDatabase(&fresh);
}

TEST_F(TamsaStorageFaultTest, ReadOnlyDirectoryServesSearchesAndIngestResumesWhenWritable)
{
    const std::string mountPoint = (m_dir.path() + QStringLiteral("/readonly")).toStdString();
    const std::string stores[] = {mountPoint + "/Server", mountPoint + "/Bare"};
    // Filled by a process of its own, so that the one below meets the stores first while they are
    // read-only (this process's stores stay warm for a while after their handles go).
    runInChild([&]() {
        for (const std::string& directory : stores) {
            void* database = openStore(directory);
            EXPECT_EQ(putOn(database, 1, 30), 30);
            Tamsa_ReleaseDatabase(&database);
        }
        return std::string();
    });
    // The second store's writers left no log files behind (all is in the database file then).
    std::filesystem::remove(stores[1] + "/tamsa.db-wal");
    std::filesystem::remove(stores[1] + "/tamsa.db-shm");
    runInChild([&]() {
        if (std::string why = enterPrivateMountNamespace();
            !why.empty() || !(why = bindReadOnly(mountPoint)).empty()) {
            return why;
        }
        Ids stored(30);
        std::iota(stored.begin(), stored.end(), 1);
        void* handles[2] = {openStore(stores[0]), openStore(stores[1])};
        for (void* database : handles) {
            expectStored(database, stored); // a read-only store still opens for searching
            EXPECT_TRUE(putOn(database, 100, 5) < 0 && putOn(database, 110, 5) < 0)
                << "ingest must fail, not count";
            expectStored(database, stored);
        }
        EXPECT_EQ(::mount(nullptr, mountPoint.c_str(), nullptr, MS_REMOUNT | MS_BIND, nullptr), 0);
        EXPECT_EQ(putOn(handles[0], 200, 12), 12) << "ingest resumes on the same handle";
        EXPECT_EQ(putOn(handles[1], 200, 12, &stored), 12);
        for (int i = 0; i < 2; ++i) {
            expectStored(handles[i], stored);
            Tamsa_ReleaseDatabase(&handles[i]);
            expectStored(nullptr, stored, stores[i]);
        }
        return std::string();
    });
}

TEST_F(TamsaStorageFaultTest, FullDirectoryRefusesIngestWithoutLosingAcknowledgedObjects)
{
    const std::string store = (m_dir.path() + QStringLiteral("/full")).toStdString();
    runInChild([&]() {
        void* database = openStore(store);
        Ids acknowledged;
        EXPECT_EQ(putOn(database, 1, 20, &acknowledged), 20);
        // Limits from "nothing may be written" (-1) and "nothing may grow" to a few pages more:
        // each batch stops at a different write (vectors, row records, the log, the commit), or fits.
        int failures = 0;
        uint64_t nextId = 1000;
        for (int64_t extra : {-1, 0, 0, 1024, 4096, 9000, 20000, 40000, 70000, 0, 2048, 16000, 100000, -1}) {
            int64_t largest = 0; // a limit at the largest file of the store lets no file grow
            for (const auto& entry : std::filesystem::recursive_directory_iterator(store)) {
                largest =
                    std::max<int64_t>(largest, entry.is_regular_file() ? int64_t(entry.file_size()) : 0);
            }
            int32_t result = 0;
            {
                const FileSizeLimit limit(extra < 0 ? 0 : largest + extra);
                result = putOn(database, nextId += 100, 12, &acknowledged);
                if (result < 0) { // searches answer while the directory is full, on a new handle too
                    expectStored(database, acknowledged);
                    expectStored(nullptr, acknowledged, store);
                }
            }
            failures += result < 0;
            EXPECT_TRUE(result == 12 || result == TAMSA_E_IO || result == TAMSA_E_BUSY) << result;
            expectStored(database, acknowledged);
        }
        EXPECT_GE(failures, 2) << "the limit never made a write fail";
        // Room again: the same handle ingests, and a new one (also in a process that never saw the
        // fault) reads everything.
        EXPECT_EQ(putOn(database, 5000, 8, &acknowledged), 8);
        expectStored(database, acknowledged);
        Tamsa_ReleaseDatabase(&database);
        expectStored(nullptr, acknowledged, store);
        return std::string();
    });
    void* after = openStore(store);
    EXPECT_GE(searchStore(after, QueryOptions()).size(), 28u);
    Tamsa_ReleaseDatabase(&after);
}

using TamsaCompactScanTest = StoreFixture;

// A search's hits with their exact score bits, in order; compact copy in use or not.
std::string exactHits(void* database, const QueryOptions& options, bool compact)
{
    tamsa::TamsaSearch::setCompactScan(compact);
    std::string out;
    for (const ResultCopy& r : searchStore(database, options)) {
        out += QString::asprintf("%llu:%a:%a ", qulonglong(r.id), r.score, r.faceScore).toStdString();
    }
    return out;
}

// Rows whose float32 score lies within 1e-6 of the threshold on both sides, some with one element
// far above the rest (coarse codes), and rows near it whose every rounding error leans away from
// the query (the estimate falls short by almost the whole bound): the compact test never rules
// out a row that reaches 0.5, and search results stay bit for bit those of the float32 scan, on
// the seeded store too. A store made without compact copies searches the same, and its writer
// rebuilds them byte for byte.
TEST_F(TamsaCompactScanTest, CompactCopyNeverChangesFeatureResults)
{
    const std::vector<float> q = randomUnitVector(1);
    std::vector<ObjectSpec> rows;
    int near = 0, leaning = 0;
    tamsa::CompactQuery query;
    tamsa::encodeCompactQuery(q, 0.5f, &query);
    for (uint32_t i = 0; i < 400; ++i) {
        std::vector<float> y = randomUnitVector(100 + i), x(kDim);
        y[i % kDim] += i % 6 == 0 ? 0.9f : 0.0f;
        const double along = std::inner_product(y.begin(), y.end(), q.begin(), 0.0);
        const double c = i % 2 ? 0.48 + 0.04 * i / 400 : 0.5 + (i % 4 ? 1e-6 : -1e-6) * (i % 50) / 50;
        const double yNorm =
            std::sqrt(std::inner_product(y.begin(), y.end(), y.begin(), 0.0) - along * along);
        double largest = 0;
        for (size_t k = 0; k < kDim; ++k) {
            x[k] = float((c * q[k] + std::sqrt(1 - c * c) * (y[k] - along * q[k]) / yNorm) *
                         (i % 8 < 2 ? 1e-3 : 7));
            largest = std::max(largest, std::fabs(double(x[k])));
        }
        const float step = float(largest / 127.0);
        for (size_t k = 0; k < kDim && i % 2; ++k) { // codes round towards a smaller dot product
            x[k] = std::fabs(x[k]) < largest
                       ? step * float(std::floor(x[k] / step) + (q[k] > 0 ? 0.49 : 0.51))
                       : x[k];
        }
        float dot = 0, norm2 = 0, qn2 = 0, ignored = 0;
        tamsa::dotNormBest()(q.data(), x.data(), kDim, &dot, &norm2);
        tamsa::dotNormScalar()(q.data(), q.data(), kDim, &ignored, &qn2);
        const float score = tamsa::cosineFromParts(dot, qn2, norm2);
        tamsa::CompactRow row;
        tamsa::encodeCompactRow(x.data(), &row);
        const int32_t exact = tamsa::compactDotScalar()(query, row);
        EXPECT_EQ(tamsa::compactDotBest()(query, row), exact) << tamsa::compactDotBestName();
        EXPECT_TRUE(score < 0.5f || tamsa::compactMayReach(query, row, exact)) << "row " << i;
        near += std::fabs(score - 0.5f) < 1e-5f;
        leaning += score >= 0.5f && float(exact) * row.scaleOverNorm * query.scaleOverNorm < query.limit;
        rows.push_back({1 + i, "Human", 1000, 1010, "{}", {}, x});
    }
    // The threshold is really tried from both sides, and some rows are kept by their own bound alone.
    EXPECT_TRUE(near > 150 && leaning > 10) << near << " near 0.5, " << leaning << " kept by the bound";
    ASSERT_EQ(put(4, rows), 400);
    const tamsa::TamsaSeeder seeder({3000, 3});
    ASSERT_EQ(seeder.seed(m_database).status, 0);

    std::vector<QueryOptions> queries(4, at({1, 2, 3, 4}));
    for (uint32_t i = 0; i < 4; ++i) { // the rows above, then seeded people by body and face
        queries[i].feature = jsonArray(i ? seeder.identityBody(i) : q);
        queries[i].faceFeature = i ? jsonArray(seeder.identityFace(i * 5)) : "";
    }
    std::vector<std::string> expected;
    for (const QueryOptions& options : queries) {
        expected.push_back(exactHits(m_database, options, false));
        EXPECT_EQ(exactHits(m_database, options, true), expected.back());
        EXPECT_GT(expected.back().size(), 100u);
    }
    const std::filesystem::path features = storagePath() + "/features", old = storagePath() + "Old/features";
    std::filesystem::copy(storagePath(), storagePath() + "Old", std::filesystem::copy_options::recursive);
    for (int n = 0; n < 8; ++n) { // as a store from before the compact copy
        std::filesystem::remove(old / ("L" + std::to_string(1 + n / 2) + (n % 2 ? ".face.q8" : ".body.q8")));
    }
    void* database = openStore(storagePath() + "Old");
    for (int pass = 0; pass < 2; ++pass) { // before and after its copies are rebuilt
        for (size_t i = 0; i < queries.size(); ++i) {
            EXPECT_EQ(exactHits(database, queries[i], true), expected[i]) << "pass " << pass;
        }
        EXPECT_EQ(Tamsa_PutObjectMetaInfo(database, 7, 4, answerJson(numberedObjects(90000, 3)).c_str()), 3);
    }
    Tamsa_ReleaseDatabase(&database);
    std::ifstream original(features / "L4.body.q8"), rebuilt(old / "L4.body.q8");
    const std::string want{std::istreambuf_iterator<char>(original), {}};
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(rebuilt), {}).substr(0, want.size()), want);
}

// Thirty days of objects, some arriving hours late or staying for weeks: a search over one hour
// finds exactly the objects that overlap it, as a scan of every row would.
TEST_F(TamsaCompactScanTest, TimeWindowScanFindsLateAndLongObjects)
{
    const std::vector<float> q = randomUnitVector(1);
    const uint32_t day = 86400, from = 1000 + 15 * day, to = from + 3600;
    std::vector<ObjectSpec> objects;
    for (uint32_t i = 0; i < 1500; ++i) {
        const uint32_t start = 1000 + i * (30 * day / 1500);
        objects.push_back({i + 1, "Human", start, start + 60, "{}", {}, i % 2 ? q : randomUnitVector(i)});
    }
    objects.push_back({5000, "Human", 1000, 1000 + 30 * day, "{}", {}, q});  // weeks long
    objects.push_back({5001, "Human", from + 100, from + 200, "{}", {}, q}); // late
    objects.push_back({5002, "Human", from - 500, from + 10, "{}", {}, q});  // late, starts before
    Ids expected;
    for (const ObjectSpec& o : objects) {
        expected.insert(expected.end(), o.body == q && o.start <= to && o.end >= from, o.id);
    }
    ASSERT_EQ(put(1, objects), int32_t(objects.size()));
    Q options = at({1}, "", 1); // q's seed
    options.start = from, options.end = to;
    Ids got = searchIds(options);
    std::sort(got.begin(), got.end());
    EXPECT_EQ(got, expected);
}

// The last handle to go empties the log: otherwise every later handle's close copied the same
// frames into the database again.
TEST_F(TamsaCompactScanTest, LastHandleLeavesAnEmptyLog)
{
    ASSERT_EQ(put(1, numberedObjects(1, 50)), 50);
    Tamsa_ReleaseDatabase(&m_database);
    EXPECT_EQ(std::filesystem::file_size(storagePath() + "/tamsa.db-wal"), 0u);
}

} // namespace
