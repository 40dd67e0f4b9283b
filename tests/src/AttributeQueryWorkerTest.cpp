// The search worker against an in-memory store: how a request becomes a query record, how
// result records become search records, the attribute search's limits and failure paths,
// re-identification scoring, and stops from other threads.
#include "AttributeQueryWorker.h"
#include "DelvixKeys.h"
#include "fakes/FakeTamsaWrapper.h"
#include "fakes/SearchRecorder.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QtGlobal>

#include <gtest/gtest.h>

#include <cmath>
#include <ctime>
#include <limits>
#include <set>
#include <thread>

using namespace Qt::StringLiterals;

namespace {

std::string thumbnails(const QJsonObject& object)
{
    return QJsonDocument(object).toJson(QJsonDocument::Compact).toStdString();
}

QJsonObject crop(const QString& image, const QJsonArray& feature)
{
    return QJsonObject{{u"image"_s, image}, {u"feature"_s, feature}};
}

FakeObject person(uint64_t id, uint32_t location, const QJsonArray& body = {}, const QJsonArray& face = {})
{
    FakeObject object;
    object.id = id;
    object.location = location;
    QJsonObject texts{{u"Thumbnail"_s, QJsonArray{crop(u"body"_s, body)}}};
    if (!face.isEmpty()) {
        QJsonObject faceCrop = crop(u"face"_s, face);
        faceCrop.insert(u"face_detection_info"_s, QJsonObject{{u"filtered"_s, 0}});
        texts.insert(u"FaceThumbnail"_s, QJsonArray{faceCrop});
    }
    object.thumbnails = thumbnails(texts);
    return object;
}

class WorkerTest : public ::testing::Test
{
protected:
    void SetUp() override { freshStore(); }
    void freshStore()
    {
        store = std::make_shared<FakeTamsaWrapper>();
        worker.setTamsa(store);
    }

    // Runs one attribute search and returns the query record the store saw.
    CapturedQuery composed(const QVariantMap& params)
    {
        SearchRecorder recorder;
        worker.query(params, recorder.callback());
        EXPECT_EQ(store->queries().size(), 1u);
        return store->queries().empty() ? CapturedQuery() : store->queries().back();
    }

    static QVariantMap request(const QStringList& locations = {u"Loc1"_s})
    {
        return {{KEY_LOC_ID_LIST, locations},
                {KEY_START_TIMESTAMP, qulonglong(1700000000000)},
                {KEY_END_TIMESTAMP, qulonglong(1700003600000)}};
    }

    std::shared_ptr<FakeTamsaWrapper> store;
    AttributeQueryWorker worker;
};

// Sets TZ for the life of the object, as an operator would set the machine's zone.
class ScopedZone
{
public:
    explicit ScopedZone(const char* zone)
        : m_previous(qgetenv("TZ"))
        , m_hadPrevious(qEnvironmentVariableIsSet("TZ"))
    {
        qputenv("TZ", zone);
    }
    ~ScopedZone()
    {
        if (m_hadPrevious) {
            qputenv("TZ", m_previous);
        } else {
            qunsetenv("TZ");
        }
    }

private:
    QByteArray m_previous;
    bool m_hadPrevious;
};

} // namespace

// ---- query composition -------------------------------------------------------------------

TEST_F(WorkerTest, TimeZoneIsStandardBiasInQuarterHoursPlus48)
{
    EXPECT_EQ(AttributeQueryWorker::makeTZDS(-480, false).wZone, 16);
    EXPECT_EQ(AttributeQueryWorker::makeTZDS(0, false).wZone, 48);
    EXPECT_EQ(AttributeQueryWorker::makeTZDS(300, false).wZone, 68);
    EXPECT_EQ(AttributeQueryWorker::makeTZDS(-330, true).wZone, 26); // truncated toward zero
    EXPECT_EQ(AttributeQueryWorker::makeTZDS(0, true).wDaylight, 1);

    // The standard offset counts even while daylight saving time is in force.
    for (const auto& [name, wZone] : std::vector<std::pair<const char*, int>>{
             {"CST-8", 16}, {"UTC0", 48}, {"EST5EDT,M3.2.0,M11.1.0", 68}}) {
        SCOPED_TRACE(name);
        ScopedZone zone(name);
        const TTAMSA_TZDS tzds = worker.getTamsaTZDS();
        EXPECT_EQ(tzds.wZone, wZone);
        if (wZone == 16) {
            EXPECT_EQ(tzds.wDaylight, 0); // a zone with no daylight saving time at all
        }
    }
    {
        ScopedZone zone("UTC0");
        const CapturedQuery query = composed(request());
        EXPECT_EQ(query.tzds.wZone, 48);
        EXPECT_EQ(query.wSize, 128);
        EXPECT_TRUE(query.zeroPadding);
    }
}

TEST_F(WorkerTest, TimesAreTruncatedToSecondsAndClampedTo32Bits)
{
    QVariantMap params = request();
    params.insert(KEY_START_TIMESTAMP, qulonglong(1700000000) * 1000 + 999);
    params.insert(KEY_END_TIMESTAMP, (qulonglong(1) << 32) * 1000 + 5000); // beyond 2106
    const CapturedQuery query = composed(params);
    EXPECT_EQ(query.start, 1700000000u);
    EXPECT_EQ(query.end, std::numeric_limits<uint32_t>::max());

    const auto record = worker.composeQueryCondition(-5000, qint64(1) << 62, {}, {}, {}, {}, false, {}, 0, 0,
                                                     {}, false, false, {}, {}, {});
    EXPECT_EQ(record.dwStartTime, 0u);
    EXPECT_EQ(record.dwEndTime, std::numeric_limits<uint32_t>::max());
}

TEST_F(WorkerTest, LocationListsDropEmptyEntriesAndEndWithZero)
{
    EXPECT_EQ(composed(request({"Loc3", "", "Loc12"})).locations, (std::vector<uint32_t>{3, 12, 0}));
    freshStore();
    // An unparsable entry becomes 0, which ends the list where the store reads it.
    EXPECT_EQ(composed(request({"Loc3", "X", "Loc5"})).locations, (std::vector<uint32_t>{3, 0}));

    for (const QStringList& locations : {QStringList{}, QStringList{"", ""}}) {
        freshStore();
        void* database = nullptr;
        void* search = nullptr;
        EXPECT_EQ(worker.getObjectMetaInfoFirst(request(locations), &database, &search),
                  AttributeQueryWorker::kNoLocation);
        EXPECT_EQ(store->initCount(), 1); // the caller releases what was initialised
        EXPECT_EQ(store->firstCount(), 0);
        store->releaseDatabase(&database);
    }
}

TEST_F(WorkerTest, ObjectTypeAndAttributeTexts)
{
    using Text = std::optional<std::string>;
    struct Row
    {
        const char* name;
        QVariantMap extra;
        Text objectType, primary, other, plate;
    };
    const std::vector<Row> rows{
        {"person attributes split into primary and other",
         {{KEY_HUMAN_INFO, R"({"Gender":1,"UpperColor":[2]})"}},
         "Human",
         R"({"Gender":1})",
         R"({"UpperColor":[2]})",
         {}},
        {"vehicle attributes",
         {{KEY_VEHICLE_INFO, R"({"Type":"car","Color":[1],"PlateNumber":"AB1"})"}},
         "Vehicle",
         R"({"PlateNumber":"AB1","Type":"car"})",
         R"({"Color":[1]})",
         {}},
        // Bad JSON still selects people, with no conditions.
        {"bad JSON", {{KEY_HUMAN_INFO, "{not json"}}, "Human", "{}", "{}", {}},
        // A plate makes it a vehicle search, keeping the person texts.
        {"plate",
         {{KEY_HUMAN_INFO, R"({"Age":"adult"})"}, {KEY_PLATE_NUMBER, "AB*"}},
         "Vehicle",
         R"({"Age":"adult"})",
         "{}",
         "AB*"},
        {"nothing given: any type, no attribute texts", {}, {}, {}, {}, {}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        freshStore();
        QVariantMap params = request();
        params.insert(row.extra);
        const CapturedQuery query = composed(params);
        EXPECT_EQ(query.objectType, row.objectType);
        EXPECT_EQ(query.primaryAttributes, row.primary);
        EXPECT_EQ(query.otherAttributes, row.other);
        EXPECT_EQ(query.plateNumber, row.plate);
    }
    EXPECT_EQ(worker.extractAndRemoveKeyFromJson(QString(), {"Age"}), (QStringList{QString(), QString()}));
    EXPECT_EQ(worker.extractAndRemoveKeyFromJson(u"{}"_s, {"Age"}), (QStringList{"{}", "{}"}));
}

TEST_F(WorkerTest, RuleFields)
{
    struct Row
    {
        const char* type; // no rule at all when null
        std::optional<std::string> trace;
        uint32_t duration, loitering;
        int32_t direction;
    };
    const char* trace = "[[0,0],[1,1],[1,0]]";
    for (const Row& row : std::vector<Row>{{nullptr, {}, 0, 0, 0},
                                           {"intrusion", trace, 30, 0, 0},
                                           {"loitering", trace, 30, 1, 0},
                                           {"lineCrossing", trace, 30, 0, 2}}) {
        SCOPED_TRACE(row.type ? row.type : "no rule");
        freshStore();
        QVariantMap params = request();
        if (row.type) {
            params.insert(KEY_RULE_INFO, QVariantMap{{KEY_TYPE, row.type},
                                                     {KEY_TRACE, trace},
                                                     {KEY_DURATION, 30},
                                                     {KEY_DIRECTION, 2}});
        }
        const CapturedQuery query = composed(params);
        EXPECT_EQ(query.trace, row.trace);
        EXPECT_EQ(query.duration, row.duration);
        EXPECT_EQ(query.loitering, row.loitering);
        EXPECT_EQ(query.direction, row.direction);
    }
}

TEST_F(WorkerTest, FeaturesAndFlags)
{
    QVariantMap params = request();
    params.insert(KEY_FEATURE, QVariantList{});
    params.insert(KEY_FACE_FEATURE, QVariantList{0.5, 1, -2.25});
    params.insert(KEY_DESCENDING, true);
    params.insert(KEY_DO_NOT_SORT, true);
    const CapturedQuery query = composed(params);
    EXPECT_FALSE(query.feature);
    EXPECT_EQ(query.faceFeature, "[0.5,1,-2.25]");
    EXPECT_EQ(query.descending, 1u);
    EXPECT_EQ(query.doNotSort, 1u);
}

// ---- attribute search ---------------------------------------------------------------------

TEST_F(WorkerTest, AttributeSearchDeliversAtMost201HitsThenTheFinalCall)
{
    for (int i = 0; i < 300; ++i) {
        store->objects.push_back(person(uint64_t(i), 1));
    }
    SearchRecorder recorder;
    worker.query(request(), recorder.callback());
    EXPECT_EQ(recorder.hits().size(), 201u);
    EXPECT_TRUE(recorder.endsWithOneEmptyFinal());
    EXPECT_EQ(recorder.hits().front().value(KEY_OBJECT_ID).toULongLong(), 0u);
    EXPECT_EQ(recorder.hits().back().value(KEY_OBJECT_ID).toULongLong(), 200u);
    EXPECT_EQ(store->closeCount(), 1);
    EXPECT_EQ(store->releaseCount(), 1);
    EXPECT_EQ(store->openSearches(), 0);
}

TEST_F(WorkerTest, FailuresEndTheSearchWithTheFinalCallOnly)
{
    store->objects = {person(1, 1), person(2, 1), person(3, 1)};
    store->firstStatus = TAMSA_E_BAD_QUERY;
    SearchRecorder failedFirst;
    worker.query(request(), failedFirst.callback());
    EXPECT_TRUE(failedFirst.hits().empty());
    EXPECT_TRUE(failedFirst.endsWithOneEmptyFinal());
    EXPECT_EQ(store->closeCount(), 0);
    EXPECT_EQ(store->releaseCount(), 1);

    // No location: the same, without a store search.
    SearchRecorder noLocation;
    worker.query(request({}), noLocation.callback());
    EXPECT_TRUE(noLocation.endsWithOneEmptyFinal());
    EXPECT_EQ(store->releaseCount(), 2);

    // A failing initialisation is logged and the search goes on.
    store->firstStatus = 0;
    store->initStatus = TAMSA_E_NO_STORAGE_PATH;
    store->failNextAfter = 2;
    SearchRecorder failedNext;
    worker.query(request(), failedNext.callback());
    EXPECT_EQ(failedNext.hits().size(), 2u); // the hits so far stand
    EXPECT_TRUE(failedNext.endsWithOneEmptyFinal());
    EXPECT_EQ(store->closeCount(), 1);
}

TEST_F(WorkerTest, SearchRecordFromResultRecord)
{
    FakeObject object;
    object.id = 9000000000ull;
    object.location = 7;
    object.start = 1700000000;
    object.end = 1700000010;
    object.trajectory = {0.1, 0.2, 0.3, 0.4, 0.5};
    object.trajectoryBytes = 40; // two and a half points: two
    object.attributes = R"({"Gender":1,"UpperColor":[2,3],"Extra":true})";
    QJsonObject face = crop(u"faceB64"_s, QJsonArray{1.5});
    face.insert(u"face_detection_info"_s, QJsonObject{{u"filtered"_s, 1}});
    QJsonObject plate{{u"image"_s, u"plateB64"_s},
                      {u"PlateNumber"_s, u"AB123"_s},
                      {u"detection_info"_s, QJsonObject{{u"filtered"_s, 0}}}};
    object.thumbnails = thumbnails({{u"Thumbnail"_s, QJsonArray{crop("bodyB64", QJsonArray{0.25, 1})}},
                                    {u"FaceThumbnail"_s, QJsonArray{face}},
                                    {u"LicensePlateThumbnail"_s, QJsonArray{plate}}});
    store->objects = {object};
    SearchRecorder recorder;
    worker.query(request({"Loc7"}), recorder.callback());
    ASSERT_EQ(recorder.hits().size(), 1u);
    const QVariantMap hit = recorder.hits().front();

    EXPECT_EQ(hit.value(KEY_OBJECT_ID).toULongLong(), 9000000000ull);
    EXPECT_EQ(hit.value(KEY_OBJ_TYPE).toString(), "Human");
    EXPECT_EQ(hit.value(KEY_START_TIMESTAMP).toLongLong(), 1700000000000);
    EXPECT_EQ(hit.value(KEY_END_TIMESTAMP).toLongLong(), 1700000010000);
    EXPECT_EQ(hit.value(KEY_LOC_ID).toString(), "Loc7");
    const QVariantList trajectory = hit.value(KEY_TRAJECTORY).toList();
    ASSERT_EQ(trajectory.size(), 2);
    EXPECT_DOUBLE_EQ(trajectory[1].toMap().value(KEY_X).toDouble(), 0.3);
    EXPECT_DOUBLE_EQ(trajectory[1].toMap().value(KEY_Y).toDouble(), 0.4);
    EXPECT_EQ(hit.value(KEY_OBJ_IMAGE).toString(), "bodyB64");
    EXPECT_EQ(hit.value(KEY_FEATURE).toList(), (QVariantList{0.25, 1}));
    // The face crop is filtered: neither image nor feature.
    EXPECT_FALSE(hit.contains(KEY_FACE_IMAGE));
    EXPECT_FALSE(hit.contains(KEY_FACE_FEATURE));
    EXPECT_EQ(hit.value(KEY_PLATE_IMAGE).toString(), "plateB64");
    EXPECT_EQ(hit.value(KEY_PLATE_NUMBER).toString(), "AB123");
    // Attributes as stored, defaults for the missing ones, nothing else.
    EXPECT_EQ(hit.value(KEY_OBJECT_GENDER).toInt(), 1);
    EXPECT_EQ(hit.value(KEY_OBJECT_UPPER_COLOR).toList(), (QVariantList{2, 3}));
    EXPECT_EQ(hit.value(KEY_OBJECT_AGE), QVariant(QString()));
    EXPECT_EQ(hit.value(KEY_OBJECT_ACCESSORIES), QVariant(QVariantList()));
    EXPECT_EQ(hit.value(KEY_OBJECT_LOWER_COLOR), QVariant(QVariantList()));
    EXPECT_EQ(hit.value(KEY_OBJECT_VEHICLE_COLOR), QVariant(QVariantList()));
    EXPECT_EQ(hit.value(KEY_OBJECT_VEHICLE_TYPE), QVariant(QString()));
    EXPECT_EQ(hit.size(), 17);
}

TEST_F(WorkerTest, SearchRecordEdgeCasesNeverFail)
{
    TTAMSA_OBJECTMETAINFO_RESULT result{};
    result.wSize = 80;
    // No texts, and a byte count with no points behind it.
    result.dwTrajectoryBytes = 40;
    QVariantMap record = AttributeQueryWorker::toSearchRecord(result);
    EXPECT_TRUE(record.value(KEY_TRAJECTORY).toList().isEmpty());
    EXPECT_TRUE(record.contains(KEY_OBJ_IMAGE));
    EXPECT_FALSE(record.value(KEY_OBJ_IMAGE).isValid());
    EXPECT_EQ(record.value(KEY_OBJ_TYPE).toString(), QString());
    EXPECT_EQ(record.value(KEY_LOC_ID).toString(), "Loc0");

    // A bare thumbnail array is the body thumbnail; empty crop arrays give no crops.
    const std::string bare = R"([{"image":"b","feature":[1]}])";
    result.pszThumbnails = bare.c_str();
    record = AttributeQueryWorker::toSearchRecord(result);
    EXPECT_EQ(record.value(KEY_OBJ_IMAGE).toString(), "b");
    const std::string empty = R"({"Thumbnail":[],"FaceThumbnail":[],"LicensePlateThumbnail":{}})";
    result.pszThumbnails = empty.c_str();
    record = AttributeQueryWorker::toSearchRecord(result);
    EXPECT_FALSE(record.value(KEY_OBJ_IMAGE).isValid());
    EXPECT_FALSE(record.contains(KEY_FACE_IMAGE));
    EXPECT_FALSE(record.contains(KEY_PLATE_IMAGE));
    // An element without "feature" gives a null feature.
    const std::string noFeature = R"({"Thumbnail":[{"image":"x"}]})";
    result.pszThumbnails = noFeature.c_str();
    record = AttributeQueryWorker::toSearchRecord(result);
    EXPECT_TRUE(record.contains(KEY_FEATURE));
    EXPECT_FALSE(record.value(KEY_FEATURE).isValid());
}

TEST_F(WorkerTest, StopEndsOnlyTheSearchItWasMeantFor)
{
    for (int i = 0; i < 50; ++i) {
        store->objects.push_back(person(uint64_t(i), 1));
    }
    // A stop before the search begins ends it with no hits, and is then used up.
    const quint64 first = worker.searchGeneration();
    EXPECT_TRUE(worker.stop(first));
    SearchRecorder stopped;
    worker.query(request(), stopped.callback());
    EXPECT_TRUE(stopped.hits().empty());
    EXPECT_TRUE(stopped.endsWithOneEmptyFinal());

    // A stop that arrives for a search that has finished does not reach the next one.
    EXPECT_FALSE(worker.stop(first));
    SearchRecorder next;
    worker.query(request(), next.callback());
    EXPECT_EQ(next.hits().size(), 50u);

    // A stop during the search, from the callback's thread here, ends it at the next check.
    SearchRecorder stoppedMidway;
    stoppedMidway.onCall = [this](bool finished, const QVariantMap& record) {
        if (!finished && record.value(KEY_OBJECT_ID).toULongLong() == 4) {
            worker.stop();
        }
    };
    worker.query(request(), stoppedMidway.callback());
    EXPECT_EQ(stoppedMidway.hits().size(), 5u);
    EXPECT_TRUE(stoppedMidway.endsWithOneEmptyFinal());
}

// ---- re-identification --------------------------------------------------------------------

TEST_F(WorkerTest, CosineScores)
{
    const auto score = [this](std::vector<float> a, QVariantList b) {
        return worker.getScore(a, b, int(a.size()));
    };
    EXPECT_NEAR(score({3, 4}, {4, 3}), 0.96f, 1e-6);
    EXPECT_FLOAT_EQ(score({1, 0}, {1, 0, 5}), 1.0f); // the candidate's tail is ignored
    EXPECT_EQ(score({1, 1}, {1}), 0.0f);             // a short candidate
    EXPECT_EQ(score({0, 0}, {0, 0}), 1.0f);
    EXPECT_EQ(score({0, 0}, {1, 0}), 0.0f);
    EXPECT_EQ(score({}, {1}), 0.0f);
    EXPECT_EQ(score({1, 0}, {-1, 0}), 0.0f); // never negative
    // Not numbers: NaN never comes out, and a text counts as 0.
    EXPECT_EQ(score({1, 0}, {std::numeric_limits<double>::quiet_NaN(), 0}), 0.0f);
    EXPECT_EQ(score({std::numeric_limits<float>::infinity(), 1}, {1, 1}), 0.0f);
    EXPECT_FLOAT_EQ(score({1, 1}, {u"x"_s, 1}), std::sqrt(0.5f));

    QVariantMap record{{KEY_FEATURE, QVariantList{1.0, 0.0}}};
    worker.calculateScore({}, {0.49f, std::sqrt(1 - 0.49f * 0.49f)}, record);
    EXPECT_EQ(record.value(KEY_SCORE).toFloat(), 0.0f); // 0.49 is stored as 0
    EXPECT_TRUE(record.contains(KEY_FACE_FEATURE));
    EXPECT_FALSE(record.value(KEY_FACE_FEATURE).isValid());
    EXPECT_EQ(record.value(KEY_FACE_SCORE).toFloat(), 0.0f);
}

TEST_F(WorkerTest, ReIdKeepsPeopleFromTheThresholdOn)
{
    worker.setParallel(false);
    FakeObject storeLow = person(1, 1);
    storeLow.score = 0.3f;
    FakeObject storeFace = person(2, 1);
    storeFace.score = 0.3f;
    storeFace.faceScore = 0.6f;
    FakeObject computedMatch = person(3, 1, QJsonArray{4, 3});
    FakeObject computedMiss = person(4, 1, QJsonArray{4, -3}, QJsonArray{1, 0});
    FakeObject notANumber = person(5, 1);
    notANumber.score = std::numeric_limits<float>::quiet_NaN();
    FakeObject vehicle = person(6, 1);
    vehicle.type = "Vehicle";
    store->objects = {storeLow, storeFace, computedMatch, computedMiss, notANumber, vehicle};

    QVariantMap params = request();
    params.insert(KEY_FEATURE, QVariantList{3, 4});
    params.insert(KEY_FACE_FEATURE, QVariantList{0, 1});
    SearchRecorder recorder;
    worker.reId(params, recorder.callback());
    ASSERT_TRUE(recorder.endsWithOneEmptyFinal());
    std::map<qulonglong, QVariantMap> hits;
    for (const QVariantMap& hit : recorder.hits()) {
        hits[hit.value(KEY_OBJECT_ID).toULongLong()] = hit;
    }
    EXPECT_EQ(hits.size(), 3u);
    ASSERT_TRUE(hits.count(2));
    EXPECT_FLOAT_EQ(hits[2].value(KEY_SCORE).toFloat(), 0.3f);
    EXPECT_FLOAT_EQ(hits[2].value(KEY_FACE_SCORE).toFloat(), 0.6f);
    EXPECT_EQ(hits[2].value(KEY_SCORE).typeId(), QMetaType::Float);
    ASSERT_TRUE(hits.count(3));
    EXPECT_NEAR(hits[3].value(KEY_SCORE).toFloat(), 0.96f, 1e-6);
    EXPECT_EQ(hits[3].value(KEY_FACE_SCORE).toFloat(), 0.0f);
    ASSERT_TRUE(hits.count(6));
    EXPECT_FALSE(hits[6].contains(KEY_SCORE));
    EXPECT_FALSE(hits[6].contains(KEY_FACE_SCORE));

    // The store request: people with no conditions, descending, unsorted, the query vectors.
    const CapturedQuery query = store->queries().front();
    EXPECT_EQ(query.objectType, "Human");
    EXPECT_EQ(query.primaryAttributes, "{}");
    EXPECT_EQ(query.descending, 1u);
    EXPECT_EQ(query.doNotSort, 1u);
    EXPECT_EQ(query.feature, "[3,4]");
    EXPECT_EQ(query.faceFeature, "[0,1]");
}

TEST_F(WorkerTest, ReIdSearchesEveryLocationOnItsOwn)
{
    for (uint32_t location = 1; location <= 3; ++location) {
        for (int i = 0; i < 2; ++i) {
            FakeObject object = person(location * 10 + uint64_t(i), location);
            object.score = 0.9f;
            store->objects.push_back(object);
        }
    }
    // An empty entry leaves no location: no store search for it, the others go on.
    QVariantMap params = request({"Loc2", "", "Loc1", "Loc3"});

    // Serial: grouped by location, in list order, all on the calling thread.
    worker.setParallel(false);
    SearchRecorder serial;
    worker.reId(params, serial.callback());
    std::vector<qulonglong> order;
    for (const SearchRecorder::Call& call : serial.calls()) {
        EXPECT_EQ(call.thread, std::this_thread::get_id());
        if (!call.finished) {
            order.push_back(call.record.value(KEY_OBJECT_ID).toULongLong());
        }
    }
    EXPECT_EQ(order, (std::vector<qulonglong>{20, 21, 10, 11, 30, 31}));
    EXPECT_TRUE(serial.endsWithOneEmptyFinal());
    EXPECT_EQ(store->firstCount(), 3);
    for (const CapturedQuery& query : store->queries()) {
        EXPECT_EQ(query.locations.size(), 2u); // one location and the 0 entry
    }

    // Parallel: every hit, from the pool's threads, and the final call after all of them.
    worker.setParallel(true);
    worker.setPeriods(3);
    SearchRecorder parallel;
    worker.reId(params, parallel.callback());
    EXPECT_EQ(parallel.hits().size(), 6u);
    EXPECT_TRUE(parallel.endsWithOneEmptyFinal());
    EXPECT_EQ(parallel.calls().back().thread, std::this_thread::get_id());
    EXPECT_NE(parallel.calls().front().thread, std::this_thread::get_id());
    EXPECT_EQ(store->openSearches(), 0);
    EXPECT_EQ(store->firstCount(), 6);
    EXPECT_EQ(store->releaseCount(), 8);

    // No location: no store call, only the final call.
    SearchRecorder none;
    worker.reId(request({}), none.callback());
    EXPECT_TRUE(none.endsWithOneEmptyFinal());
    EXPECT_EQ(store->initCount(), 8);

    // One location on its own: hits only, no final call.
    SearchRecorder single;
    worker.partialReIdSearch(request({"Loc3"}), single.callback());
    EXPECT_EQ(single.finals(), 0);
    ASSERT_EQ(single.hits().size(), 2u);
    EXPECT_EQ(single.hits().front().value(KEY_LOC_ID).toString(), "Loc3");
}

TEST_F(WorkerTest, StopDuringReIdEndsEveryLocation)
{
    store->holdUntilAbort = true;
    for (uint32_t location = 1; location <= 4; ++location) {
        store->objects.push_back(person(location, location));
    }
    worker.setPeriods(4);
    SearchRecorder recorder;
    std::thread search([&] { worker.reId(request({"Loc1", "Loc2", "Loc3", "Loc4"}), recorder.callback()); });
    const bool allSearching = store->waitForHeldNext(4, 10000);
    EXPECT_TRUE(allSearching);
    worker.stop();
    EXPECT_TRUE(recorder.waitFinished());
    search.join();
    EXPECT_TRUE(recorder.endsWithOneEmptyFinal());
    EXPECT_TRUE(recorder.hits().empty());
    EXPECT_EQ(store->abortCount(), 4);
    EXPECT_EQ(store->closeCount(), 4);
    EXPECT_EQ(store->openSearches(), 0);

    // The stop is over with its search: the next one runs in full.
    store->holdUntilAbort = false;
    store->objects.front().score = 0.8f;
    SearchRecorder next;
    worker.reId(request({"Loc1"}), next.callback());
    EXPECT_EQ(next.hits().size(), 1u);
}

TEST_F(WorkerTest, SettingsAndHandleRegistry)
{
    AttributeQueryWorker fresh;
    EXPECT_GE(fresh.periods(), 1);
    EXPECT_TRUE(fresh.parallel());
    worker.setPeriods(0);
    EXPECT_EQ(worker.periods(), 1);
    worker.setPeriods(-3);
    EXPECT_EQ(worker.periods(), 1);

    // One entry per thread: a second registration replaces the first, removal forgets it.
    store->objects = {person(1, 1), person(2, 1)};
    void* database = nullptr;
    void* first = nullptr;
    void* second = nullptr;
    ASSERT_EQ(worker.getObjectMetaInfoFirst(request(), &database, &first), 0);
    ASSERT_EQ(worker.getObjectMetaInfoFirst(request(), &database, &second), 0);
    worker.setTamsaHandle(first);
    worker.setTamsaHandle(second);
    worker.stop();
    EXPECT_EQ(store->abortCount(), 1);
    TTAMSA_OBJECTMETAINFO_RESULT result{};
    result.wSize = 80;
    EXPECT_EQ(store->GetObjectMetaInfoNext(first, &result), 0);
    EXPECT_EQ(store->GetObjectMetaInfoNext(second, &result), TAMSA_E_ABORTED);
    worker.removeTamsaHandle();
    worker.stop();
    EXPECT_EQ(store->abortCount(), 1);
    store->GetObjectMetaInfoClose(first);
    store->GetObjectMetaInfoClose(second);
}
