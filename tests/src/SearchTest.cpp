// Attribute and re-identification search over the real store, filled with a few hand-made objects:
// which requests find which objects with which fields, limits, failures and stops of the worker,
// the scheduler's order and stops, and the search commands through Request.
#include "AttributeQueryWorker.h"
#include "AttributeRetriever.h"
#include "DelvixKeys.h"
#include "HostFakes.h"
#include "PluginDelvixSrv.h"
#include "ReplyRecorder.h"
#include "SearchStore.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QTemporaryDir>

#include <gtest/gtest.h>

#include <cmath>
#include <future>
#include <limits>
#include <optional>
#include <thread>

using namespace Qt::StringLiterals;

namespace {

constexpr qint64 T = 1700000000; // seconds

int g_clientA = 0;
int g_clientB = 0;
void* const kClientA = &g_clientA;
void* const kClientB = &g_clientB;

// A stored 512-float vector along one axis: vectors of different axes score 0, of one axis 1.
QJsonArray axis(int index)
{
    QJsonArray vector;
    for (int i = 0; i < 512; ++i) {
        vector.append(i == index ? 1 : 0);
    }
    return vector;
}

// The worker's callback into a reply recorder (payload: the record), noting each call's thread.
class Hits : public ReplyRecorder
{
public:
    AttributeQueryWorker::Callback worker()
    {
        return [this, reply = callback()](bool finished, const QVariantMap& record) {
            if (before) {
                before(finished, record);
            }
            {
                QMutexLocker lock(&m_mutex);
                m_threads.push_back(std::this_thread::get_id());
            }
            reply(finished, QString(), QString(), record);
        };
    }
    std::vector<qulonglong> ids() const
    {
        std::vector<qulonglong> ids;
        for (const QVariant& hit : progress()) {
            ids.push_back(hit.toMap().value(KEY_OBJECT_ID).toULongLong());
        }
        return ids;
    }
    // Exactly one final call, the last, with an empty record.
    bool endedOnce() const { return finalCount() == 1 && last().final && last().payload.toMap().isEmpty(); }
    std::vector<std::thread::id> threads() const
    {
        QMutexLocker lock(&m_mutex);
        return m_threads;
    }

    std::function<void(bool, const QVariantMap&)> before; // runs on the calling thread, first

private:
    mutable QMutex m_mutex;
    std::vector<std::thread::id> m_threads; // guarded by m_mutex
};

// A one-shot gate a callback waits at while the test acts.
struct Gate
{
    std::promise<void> opened;
    std::shared_future<void> future = opened.get_future().share();
    void open() { opened.set_value(); }
    bool wait()
    {
        return future.wait_for(std::chrono::milliseconds(scaledMs(10000))) == std::future_status::ready;
    }
};

QVariantMap request(const QStringList& locations, const QVariantMap& extra = {})
{
    QVariantMap params{{KEY_LOC_ID_LIST, locations},
                       {KEY_START_TIMESTAMP, qulonglong(T) * 1000},
                       {KEY_END_TIMESTAMP, qulonglong(T + 3600) * 1000}};
    params.insert(extra);
    return params;
}

// The first `count` of the 300 people at Loc3, one a second from T + 1000.
QVariantMap crowd(int count)
{
    return request({u"Loc3"_s}, {{KEY_START_TIMESTAMP, qulonglong(T + 1000) * 1000},
                                 {KEY_END_TIMESTAMP, qulonglong(T + 1000 + count - 1) * 1000}});
}

class SearchTest : public ::testing::Test
{
protected:
    // Loc1 from T: person 1 walks through the zone and across the line x = 0.5, person 2 stays in
    // the zone, vehicle 3 has a plate, 9 is outside the hour. Loc2: person 4, the body of person 1.
    // Loc3: 300 people without vectors, one a second from T + 1000.
    static void SetUpTestSuite()
    {
        s_folder = new QTemporaryDir;
        SearchStore store(s_folder->path());
        QByteArray loc1 = R"([
          {"ID":1, "ObjectType":"Human", "StartTime":1700000010, "EndTime":1700000020,
           "Attributes":{"Age":"adult", "Gender":1, "Accessories":[1], "UpperColor":[2,3], "LowerColor":[4]},
           "Trajectory":[{"x":0.1,"y":0.5}, {"x":0.4,"y":0.5}, {"x":0.6,"y":0.5}, {"x":0.9,"y":0.5}],
           "Thumbnail":[{"image":"body1", "feature":AXIS0}],
           "FaceThumbnail":[{"image":"face1", "feature":AXIS1, "face_detection_info":{"filtered":0}}]},
          {"ID":2, "ObjectType":"Human", "StartTime":1700000030, "EndTime":1700000100,
           "Attributes":{"Gender":2, "UpperColor":[5]},
           "Trajectory":[{"x":0.45,"y":0.45}, {"x":0.46,"y":0.5}, {"x":0.45,"y":0.55}],
           "Thumbnail":[{"image":"body2", "feature":AXIS2}],
           "FaceThumbnail":[{"image":"face2", "feature":AXIS3, "face_detection_info":{"filtered":1}}]},
          {"ID":3, "ObjectType":"Vehicle", "StartTime":1700000050, "EndTime":1700000060,
           "Attributes":{"Type":1, "Color":[4], "PlateNumber":"AB123"},
           "Trajectory":[{"x":0.9,"y":0.9}, {"x":0.95,"y":0.95}], "Thumbnail":[{"image":"body3"}],
           "LicensePlateThumbnail":[{"image":"plate3", "PlateNumber":"AB123", "detection_info":{"filtered":0}}]},
          {"ID":9, "ObjectType":"Human", "StartTime":1700005000, "EndTime":1700005001}])";
        QByteArray loc2 = R"([{"ID":4, "ObjectType":"Human", "StartTime":1700000015, "EndTime":1700000016,
           "Attributes":{"Gender":1}, "Thumbnail":[{"image":"body4", "feature":AXIS0}]}])";
        for (int i = 0; i < 4; ++i) {
            const QByteArray vector = QJsonDocument(axis(i)).toJson(QJsonDocument::Compact);
            loc1.replace("AXIS" + QByteArray::number(i), vector);
            loc2.replace("AXIS" + QByteArray::number(i), vector);
        }
        QByteArrayList crowd;
        for (qint64 i = 0; i < 300; ++i) {
            crowd.append(QStringLiteral(R"({"ID":%1, "ObjectType":"Human", "StartTime":%2, "EndTime":%2})")
                             .arg(100 + i)
                             .arg(T + 1000 + i)
                             .toUtf8());
        }
        ASSERT_EQ(store.put(1, loc1), 4);
        ASSERT_EQ(store.put(2, loc2), 1);
        ASSERT_EQ(store.put(3, "[" + crowd.join(',') + "]"), 300);
    }
    static void TearDownTestSuite()
    {
        delete s_folder;
        s_folder = nullptr;
    }

    void SetUp() override { worker->setTamsa(store); }

    std::vector<qulonglong> find(const QVariantMap& params)
    {
        Hits hits;
        worker->query(params, hits.worker());
        EXPECT_TRUE(hits.endedOnce());
        return hits.ids();
    }

    static QTemporaryDir* s_folder;
    std::shared_ptr<SearchStore> store = std::make_shared<SearchStore>(s_folder->path());
    std::shared_ptr<AttributeQueryWorker> worker = std::make_shared<AttributeQueryWorker>();
};

QTemporaryDir* SearchTest::s_folder = nullptr;

using Ids = std::vector<qulonglong>;

} // namespace

TEST_F(SearchTest, RequestsFindTheirObjects)
{
    const QString zone = u"[[0.3,0.3],[0.7,0.3],[0.7,0.7],[0.3,0.7]]"_s;
    const QString line = u"[[0.5,0],[0.5,1]]"_s;
    const auto rule = [](const QString& type, const QString& trace, int direction) {
        return QVariantMap{{KEY_RULE_INFO, QVariantMap{{KEY_TYPE, type},
                                                       {KEY_TRACE, trace},
                                                       {KEY_DURATION, 30},
                                                       {KEY_DIRECTION, direction}}}};
    };
    const QStringList loc1{u"Loc1"_s};
    struct Row
    {
        const char* name;
        QVariantMap params;
        Ids expected; // in order
    };
    const std::vector<Row> rows{
        {"one location, in time order", request(loc1), {1, 2, 3}},
        {"two locations merged by time", request({u"Loc1"_s, u""_s, u"Loc2"_s}), {1, 4, 2, 3}},
        {"unsorted: location by location",
         request({u"Loc2"_s, u"Loc1"_s}, {{KEY_DO_NOT_SORT, true}}),
         {4, 1, 2, 3}},
        {"descending", request(loc1, {{KEY_DESCENDING, true}}), {3, 2, 1}},
        {"an unparsable location ends the list", request({u"Loc1"_s, u"X"_s, u"Loc2"_s}), {1, 2, 3}},
        {"no location", request({}), {}},
        {"empty locations only", request({u""_s, u""_s}), {}},
        // Milliseconds are cut to seconds, not rounded: 20.999 s still overlaps person 1's end,
        // and 29.999 s ends before person 2 starts.
        {"window in milliseconds",
         request(loc1, {{KEY_START_TIMESTAMP, qulonglong(T + 20) * 1000 + 999},
                        {KEY_END_TIMESTAMP, qulonglong(T + 29) * 1000 + 999}}),
         {1}},
        {"an end beyond 32-bit seconds is the last second",
         request(loc1, {{KEY_END_TIMESTAMP, (qulonglong(1) << 32) * 1000 + 5000}}),
         {1, 2, 3, 9}},
        {"primary person attribute",
         request({u"Loc1"_s, u"Loc2"_s}, {{KEY_HUMAN_INFO, R"({"Gender":1})"}}),
         {1, 4}},
        {"other person attribute", request(loc1, {{KEY_HUMAN_INFO, R"({"UpperColor":[5]})"}}), {2}},
        {"both kinds must hold", request(loc1, {{KEY_HUMAN_INFO, R"({"Gender":1,"UpperColor":[5]})"}}), {}},
        {"bad JSON still means people", request(loc1, {{KEY_HUMAN_INFO, "{not json"}}), {1, 2}},
        {"vehicle attributes",
         request(loc1, {{KEY_VEHICLE_INFO, R"({"Type":1,"Color":[4],"PlateNumber":"AB1"})"}}),
         {3}},
        {"a vehicle attribute that differs", request(loc1, {{KEY_VEHICLE_INFO, R"({"Color":[5]})"}}), {}},
        {"plate pattern", request(loc1, {{KEY_PLATE_NUMBER, "ab*"}}), {3}},
        {"intrusion", request(loc1, rule(u"intrusion"_s, zone, 0)), {1, 2}},
        {"loitering", request(loc1, rule(KEY_LOITERING, zone, 0)), {2}},
        {"line crossed positive to negative", request(loc1, rule(KEY_LINE_CROSSING, line, 2)), {1}},
        {"line not crossed negative to positive", request(loc1, rule(KEY_LINE_CROSSING, line, 1)), {}},
        {"a direction counts only for a line rule", request(loc1, rule(u"intrusion"_s, line, 1)), {1}},
        {"body vector", request(loc1, {{KEY_FEATURE, axis(0).toVariantList()}}), {1}},
        {"face vector", request(loc1, {{KEY_FACE_FEATURE, axis(1).toVariantList()}}), {1}},
        {"an empty vector is no condition", request(loc1, {{KEY_FEATURE, QVariantList()}}), {1, 2, 3}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        EXPECT_EQ(find(row.params), row.expected);
    }
}

TEST_F(SearchTest, HitsCarryTheStoredFields)
{
    // Type, location, times and trajectory are the corpus replay's; here what only a store gives.
    Hits hits;
    worker->query(request({u"Loc1"_s}), hits.worker());
    ASSERT_EQ(hits.ids(), (Ids{1, 2, 3}));
    const auto expectFields = [](const QVariant& hit, const QVariantMap& fields) {
        for (auto it = fields.begin(); it != fields.end(); ++it) {
            EXPECT_EQ(hit.toMap().value(it.key()), it.value()) << qPrintable(it.key());
        }
        EXPECT_EQ(hit.toMap().size(), 17);
    };
    expectFields(hits.progress()[0], {{KEY_OBJ_IMAGE, u"body1"_s},
                                      {KEY_FEATURE, axis(0).toVariantList()},
                                      {KEY_FACE_IMAGE, u"face1"_s},
                                      {KEY_FACE_FEATURE, axis(1).toVariantList()},
                                      {KEY_OBJECT_AGE, u"adult"_s},
                                      {KEY_OBJECT_GENDER, 1},
                                      {KEY_OBJECT_ACCESSORIES, QVariantList{1}},
                                      {KEY_OBJECT_UPPER_COLOR, QVariantList{2, 3}},
                                      {KEY_OBJECT_LOWER_COLOR, QVariantList{4}},
                                      {KEY_OBJECT_VEHICLE_COLOR, QVariantList()},
                                      {KEY_OBJECT_VEHICLE_TYPE, QString()}});
    expectFields(hits.progress()[2], {{KEY_OBJ_IMAGE, u"body3"_s},
                                      {KEY_FEATURE, QVariant()},
                                      {KEY_PLATE_IMAGE, u"plate3"_s},
                                      {KEY_PLATE_NUMBER, u"AB123"_s},
                                      {KEY_OBJECT_VEHICLE_COLOR, QVariantList{4}},
                                      {KEY_OBJECT_VEHICLE_TYPE, 1},
                                      {KEY_OBJECT_AGE, QString()},
                                      {KEY_OBJECT_ACCESSORIES, QVariantList()}});
    // A filtered face crop gives neither image nor vector.
    EXPECT_FALSE(hits.progress()[1].toMap().contains(KEY_FACE_IMAGE));
    EXPECT_FALSE(hits.progress()[1].toMap().contains(KEY_FACE_FEATURE));
}

TEST_F(SearchTest, AtMost201HitsAndFailuresEndWithTheFinalCallOnly)
{
    Hits many;
    worker->query(crowd(300), many.worker());
    EXPECT_EQ(many.ids().size(), 201u);
    EXPECT_EQ(many.ids().back(), 300u);
    EXPECT_TRUE(many.endedOnce());
    EXPECT_EQ(store->closes, 1);
    EXPECT_EQ(store->releases, 1);

    store->firstStatus = TAMSA_E_BAD_QUERY;
    EXPECT_EQ(find(crowd(3)), Ids{});
    EXPECT_EQ(store->closes, 1); // nothing was opened, nothing is closed
    EXPECT_EQ(store->releases, 2);

    // A failing initialisation is only logged; a failing Next keeps the hits so far.
    store->firstStatus = 0;
    store->initStatus = TAMSA_E_NO_STORAGE_PATH;
    store->failNextAfter = 2;
    EXPECT_EQ(find(crowd(5)), (Ids{100, 101}));
    EXPECT_EQ(store->open(), 0);
    EXPECT_EQ(store->releases, 3);
}

TEST_F(SearchTest, StopEndsOnlyTheSearchItWasMeantFor)
{
    // A stop before the search begins ends it with no hits, and is then used up.
    const quint64 first = worker->searchGeneration();
    EXPECT_TRUE(worker->stop(first));
    EXPECT_EQ(find(crowd(50)), Ids{});
    EXPECT_FALSE(worker->stop(first));
    EXPECT_EQ(find(crowd(50)).size(), 50u);

    // A stop during the search ends it at the next check.
    Hits stopped;
    stopped.before = [this](bool finished, const QVariantMap& record) {
        if (!finished && record.value(KEY_OBJECT_ID).toULongLong() == 104) {
            worker->stop();
        }
    };
    worker->query(crowd(50), stopped.worker());
    EXPECT_EQ(stopped.ids().size(), 5u);
    EXPECT_TRUE(stopped.endedOnce());
}

TEST_F(SearchTest, ReIdSearchesEveryLocationOnItsOwn)
{
    // An empty entry leaves no location: no store search for it, the others go on.
    const QVariantMap params =
        request({u"Loc2"_s, u""_s, u"Loc1"_s, u"Loc3"_s}, {{KEY_FEATURE, axis(0).toVariantList()},
                                                           {KEY_FACE_FEATURE, axis(1).toVariantList()},
                                                           {KEY_HUMAN_INFO, R"({"Gender":2})"}});
    worker->setParallel(false);
    Hits serial;
    worker->reId(params, serial.worker());
    // In list order, the person conditions ignored, on the calling thread; scores as the store gave them.
    ASSERT_EQ(serial.ids(), (Ids{4, 1}));
    EXPECT_TRUE(serial.endedOnce());
    for (const std::thread::id& thread : serial.threads()) {
        EXPECT_EQ(thread, std::this_thread::get_id());
    }
    EXPECT_EQ(store->firsts, 3);
    EXPECT_EQ(store->maxOpen, 1);
    const QVariantMap person = serial.progress()[1].toMap();
    EXPECT_EQ(person.value(KEY_SCORE).typeId(), QMetaType::Float);
    EXPECT_FLOAT_EQ(person.value(KEY_SCORE).toFloat(), 1.0f);
    EXPECT_FLOAT_EQ(person.value(KEY_FACE_SCORE).toFloat(), 1.0f);

    // Parallel: every hit from the pool's threads, the final call on the caller's after all of them.
    worker->setParallel(true);
    worker->setPeriods(3);
    Hits parallel;
    worker->reId(params, parallel.worker());
    EXPECT_EQ(parallel.ids().size(), 2u);
    EXPECT_TRUE(parallel.endedOnce());
    EXPECT_NE(parallel.threads().front(), std::this_thread::get_id());
    EXPECT_EQ(parallel.threads().back(), std::this_thread::get_id());
    EXPECT_EQ(store->open(), 0);

    // No location: only the final call. One location on its own: hits only, no final call.
    Hits none;
    worker->reId(request({}), none.worker());
    EXPECT_TRUE(none.endedOnce());
    Hits single;
    worker->partialReIdSearch(request({u"Loc1"_s}, {{KEY_FACE_FEATURE, axis(1).toVariantList()}}),
                              single.worker());
    EXPECT_EQ(single.ids(), Ids{1});
    EXPECT_EQ(single.finalCount(), 0);
    // Every search is off the stop list once it is closed.
    worker->stop();
    EXPECT_EQ(store->staleAborts, 0);
}

TEST_F(SearchTest, StopDuringReIdEndsEveryLocation)
{
    store->holdUntilAbort = true;
    worker->setPeriods(3);
    Hits held;
    std::thread search([&] { worker->reId(request({u"Loc1"_s, u"Loc2"_s, u"Loc3"_s}), held.worker()); });
    EXPECT_TRUE(store->waitHeld(3));
    worker->stop();
    search.join();
    EXPECT_TRUE(held.endedOnce());
    EXPECT_TRUE(held.ids().empty());
    EXPECT_EQ(store->aborts, 3);
    EXPECT_EQ(store->staleAborts, 0);
    EXPECT_EQ(store->closes, 3);

    // The stop is over with its search: the next one runs in full.
    store->holdUntilAbort = false;
    Hits next;
    worker->reId(request({u"Loc1"_s}, {{KEY_FEATURE, axis(0).toVariantList()}}), next.worker());
    EXPECT_EQ(next.ids(), Ids{1});
}

TEST_F(SearchTest, CosineScores)
{
    const auto score = [this](std::vector<float> a, QVariantList b) {
        return worker->getScore(a, b, int(a.size()));
    };
    EXPECT_NEAR(score({3, 4}, {4, 3}), 0.96f, 1e-6);
    EXPECT_FLOAT_EQ(score({1, 0}, {1, 0, 5}), 1.0f); // the candidate's tail is ignored
    EXPECT_EQ(score({1, 1}, {1}), 0.0f);             // a short candidate
    EXPECT_EQ(score({0, 0}, {0, 0}), 1.0f);
    EXPECT_EQ(score({0, 0}, {1, 0}), 0.0f);
    EXPECT_EQ(score({1, 0}, {-1, 0}), 0.0f); // never negative
    EXPECT_EQ(score({1, 0}, {std::numeric_limits<double>::quiet_NaN(), 0}), 0.0f);
    EXPECT_EQ(score({std::numeric_limits<float>::infinity(), 1}, {1, 1}), 0.0f);
    EXPECT_FLOAT_EQ(score({1, 1}, {u"x"_s, 1}), std::sqrt(0.5f)); // a text counts as 0

    QVariantMap record{{KEY_FEATURE, QVariantList{1.0, 0.0}}};
    worker->calculateScore({}, {0.49f, std::sqrt(1 - 0.49f * 0.49f)}, record);
    EXPECT_EQ(record.value(KEY_SCORE).toFloat(), 0.0f); // below the threshold it is stored as 0
}

TEST_F(SearchTest, TimeZoneIsTheStandardBiasInQuarterHours)
{
    EXPECT_EQ(AttributeQueryWorker::makeTZDS(-480, false).wZone, 16);
    EXPECT_EQ(AttributeQueryWorker::makeTZDS(300, false).wZone, 68);
    EXPECT_EQ(AttributeQueryWorker::makeTZDS(-330, true).wZone, 26); // truncated toward zero
    EXPECT_EQ(AttributeQueryWorker::makeTZDS(0, true).wDaylight, 1);
    const std::optional<QByteArray> previous =
        qEnvironmentVariableIsSet("TZ") ? std::optional(qgetenv("TZ")) : std::nullopt;
    // The standard offset counts even while daylight saving time is in force.
    for (const auto& [zone, wZone] : std::vector<std::pair<const char*, int>>{
             {"CST-8", 16}, {"UTC0", 48}, {"EST5EDT,M3.2.0,M11.1.0", 68}}) {
        qputenv("TZ", zone);
        EXPECT_EQ(worker->getTamsaTZDS().wZone, wZone) << zone;
    }
    previous ? qputenv("TZ", *previous) : qunsetenv("TZ");
}

// ---- the scheduler: one search at a time, in arrival order ----------------------------------

class RetrieverTest : public SearchTest
{
protected:
    void SetUp() override
    {
        SearchTest::SetUp();
        retriever->setAttributeRetriever(worker);
    }
    std::unique_ptr<AttributeRetriever> retriever = std::make_unique<AttributeRetriever>();
};

TEST_F(RetrieverTest, SearchesRunOneAfterAnotherInArrivalOrder)
{
    store->nextDelayMs = 2;
    Hits first;
    Hits second;
    Hits third;
    std::atomic<bool> secondStartedEarly{false};
    second.before = [&](bool, const QVariantMap&) {
        secondStartedEarly = secondStartedEarly || !first.finalCount();
    };
    retriever->query(kClientA, crowd(5), first.worker());
    // Null identifiers are searches like any other: queued, never on a second thread, and a
    // stop for no query stops none of them.
    retriever->query(nullptr, crowd(5), second.worker());
    retriever->query(nullptr, crowd(5), third.worker());
    retriever->stop(nullptr);
    EXPECT_TRUE(third.waitFinal());
    EXPECT_TRUE(first.endedOnce());
    EXPECT_TRUE(second.endedOnce());
    EXPECT_EQ(first.ids().size(), 5u);
    EXPECT_EQ(second.ids().size(), 5u);
    EXPECT_EQ(third.ids().size(), 5u);
    EXPECT_FALSE(secondStartedEarly);
    EXPECT_EQ(store->maxOpen, 1);
    EXPECT_FALSE(retriever->hasNextTask());
}

TEST_F(RetrieverTest, StopCancelsAQueuedSearchAtOnceAndEndsTheRunningOne)
{
    Gate secondHit;
    Gate proceed;
    Hits running;
    running.before = [&](bool finished, const QVariantMap& record) {
        if (!finished && record.value(KEY_OBJECT_ID).toULongLong() == 101) {
            secondHit.open();
            proceed.wait();
        }
    };
    Hits sameClient;
    Hits cancelled;
    retriever->query(kClientA, crowd(300), running.worker());
    ASSERT_TRUE(secondHit.wait());
    retriever->query(kClientA, crowd(300), sameClient.worker());
    retriever->query(kClientB, crowd(300), cancelled.worker());
    // A queued search is answered on the stopping thread while the running one is under way.
    retriever->stop(kClientB);
    EXPECT_TRUE(cancelled.endedOnce());
    EXPECT_EQ(cancelled.threads().front(), std::this_thread::get_id());
    EXPECT_TRUE(retriever->hasNextTask());
    // The running search ends at its next check; the queued one of the same client is not
    // cancelled and runs next, in full.
    retriever->stop(kClientA);
    proceed.open();
    EXPECT_TRUE(sameClient.waitFinal());
    EXPECT_EQ(running.ids().size(), 2u);
    EXPECT_TRUE(running.endedOnce());
    EXPECT_EQ(sameClient.ids().size(), 201u);
    EXPECT_EQ(store->firsts, 2);
    // A stop for a search that is neither queued nor running does nothing.
    retriever->stop(kClientB);
    EXPECT_EQ(cancelled.finalCount(), 1);
}

TEST_F(RetrieverTest, LateStopNeverEndsTheFollowingSearch)
{
    // The window: the first search has cleared its stop flag and is making its final call,
    // while the scheduler still names it current. A stop of that client decided now is meant
    // for the first search and must not reach the second, queued under the same client.
    Gate finalEntered;
    Gate proceed;
    Hits first;
    first.before = [&](bool finished, const QVariantMap&) {
        if (finished) {
            finalEntered.open();
            proceed.wait();
        }
    };
    Hits second;
    retriever->query(kClientA, crowd(5), first.worker());
    retriever->query(kClientA, crowd(5), second.worker());
    ASSERT_TRUE(finalEntered.wait());
    retriever->stop(kClientA);
    proceed.open();
    EXPECT_TRUE(second.waitFinal());
    EXPECT_EQ(second.ids().size(), 5u);
}

TEST_F(RetrieverTest, SearchStartedWhileTheThreadEndsStillRuns)
{
    for (int round = 0; round < 200; ++round) {
        Hits hits;
        retriever->query(round % 2 ? kClientA : kClientB, crowd(1), hits.worker());
        ASSERT_TRUE(hits.waitFinal(5000)) << "round " << round;
        EXPECT_EQ(hits.ids().size(), 1u);
    }
}

TEST_F(RetrieverTest, DestructionCancelsQueuedStopsRunningAndWaits)
{
    store->nextDelayMs = 2;
    Hits running;
    Hits queuedA;
    Hits queuedB;
    retriever->query(kClientA, crowd(300), running.worker());
    ASSERT_TRUE(waitFor([&] { return !running.progress().empty(); }));
    retriever->reId(kClientB, crowd(300), queuedA.worker());
    retriever->query(kClientB, crowd(300), queuedB.worker());
    retriever.reset();
    // Once the scheduler is gone, every search has had its one final call and nothing of it runs.
    EXPECT_TRUE(running.endedOnce());
    EXPECT_TRUE(queuedA.endedOnce());
    EXPECT_TRUE(queuedB.endedOnce());
    EXPECT_TRUE(queuedA.ids().empty());
    EXPECT_EQ(store->open(), 0);
    EXPECT_EQ(store->firsts, 1);
}

TEST_F(RetrieverTest, DestroyedFromItsOwnCallback)
{
    // The last owner lets go inside a search's final call, on the scheduler's own thread.
    std::weak_ptr<AttributeQueryWorker> owned = worker;
    worker.reset();
    AttributeRetriever* scheduler = retriever.release();
    Gate firstHit;
    Gate proceed;
    Hits first;
    first.before = [&, scheduler](bool finished, const QVariantMap& record) {
        if (finished) {
            delete scheduler;
        } else if (record.value(KEY_OBJECT_ID).toULongLong() == 100) {
            firstHit.open();
            proceed.wait();
        }
    };
    Hits queued;
    scheduler->query(kClientA, crowd(3), first.worker());
    ASSERT_TRUE(firstHit.wait());
    scheduler->query(kClientB, crowd(3), queued.worker());
    proceed.open();
    EXPECT_TRUE(queued.waitFinal());
    EXPECT_TRUE(queued.endedOnce());
    EXPECT_TRUE(queued.ids().empty());
    EXPECT_EQ(first.ids().size(), 3u);
    EXPECT_EQ(store->firsts, 1);
    // The thread lets go of the worker on its way out.
    EXPECT_TRUE(waitFor([&] { return owned.expired(); }));
}

// ---- the search commands through Request ----------------------------------------------------

class SearchCommandsTest : public SearchTest
{
protected:
    void SetUp() override
    {
        SearchTest::SetUp();
        retriever->setAttributeRetriever(worker);
        plugin.setAttributeRetriever(retriever);
        collector->cameras.insert(u"Loc1"_s, u"camera-1"_s);
        plugin.setCameraInformationCollector(collector);
        plugin.InitialPluginBase(nullptr);
    }
    static RequestSenderInfo sender(void* client)
    {
        RequestSenderInfo info;
        info.senderHandle = client;
        return info;
    }

    QSharedPointer<AttributeRetriever> retriever = QSharedPointer<AttributeRetriever>::create();
    QSharedPointer<FakeCollector> collector = QSharedPointer<FakeCollector>::create();
    PluginDelvixSrv plugin;
};

TEST_F(SearchCommandsTest, DisabledStartCommandsAnswerAtOnceAndSearchNothing)
{
    plugin.setEnableDelvix({{u"faceEnable"_s, true}}); // no "enable": off
    EXPECT_EQ(collector->settings().value(u"faceEnable"_s), QVariant(true));
    for (const QString& command : {CMD_START_SEARCH, CMD_START_REID_SEARCH}) {
        ReplyRecorder replies;
        plugin.Request(command, request({u"Loc1"_s}), sender(kClientA), replies.callback());
        ASSERT_EQ(replies.replies().size(), 1u) << qPrintable(command);
        EXPECT_TRUE(replies.last().final);
        EXPECT_EQ(replies.last().code, RC_SUCCESS);
        EXPECT_FALSE(replies.last().payload.isValid());
    }
    EXPECT_EQ(store->releases, 0);

    plugin.setEnableDelvix({{u"enable"_s, true}});
    ReplyRecorder replies;
    plugin.Request(CMD_START_SEARCH, request({u"Loc1"_s}), sender(kClientA), replies.callback());
    EXPECT_TRUE(replies.waitFinal());
    EXPECT_EQ(replies.progress().size(), 3u);
}

TEST_F(SearchCommandsTest, HitsStreamWithTheirCameraThenTheFinalReply)
{
    const QVariantMap bodyOfPerson1 =
        request({u"Loc1"_s, u"Loc2"_s}, {{KEY_FEATURE, axis(0).toVariantList()}});
    // The third time without a camera directory: every hit gets an empty camera.
    for (const QString& command : {CMD_START_SEARCH, CMD_START_REID_SEARCH, CMD_START_SEARCH}) {
        ReplyRecorder replies;
        plugin.Request(command, bodyOfPerson1, sender(kClientA), replies.callback());
        ASSERT_TRUE(replies.waitFinal()) << qPrintable(command);
        std::map<qulonglong, QVariant> cameras; // Loc2 has no camera
        for (const QVariant& hit : replies.progress()) {
            cameras[hit.toMap().value(KEY_OBJECT_ID).toULongLong()] = hit.toMap().value(KEY_NODE_ID);
        }
        const QString camera1 = collector ? u"camera-1"_s : QString();
        EXPECT_EQ(cameras, (std::map<qulonglong, QVariant>{{1, camera1}, {4, QString()}}));
        EXPECT_EQ(replies.replies().size(), 3u);
        EXPECT_EQ(replies.finalCount(), 1);
        EXPECT_EQ(replies.last().code, RC_SUCCESS);
        EXPECT_FALSE(replies.last().payload.isValid());
        if (command == CMD_START_REID_SEARCH) {
            collector.reset();
            plugin.setCameraInformationCollector(collector);
        }
    }
}

TEST_F(SearchCommandsTest, StopCommandsStopOnlyTheClientsSearch)
{
    store->nextDelayMs = 10; // a search of some seconds unless stopped
    for (const QString& stopCommand : {CMD_STOP_SEARCH, CMD_STOP_REID_SEARCH}) {
        ReplyRecorder running;
        plugin.Request(CMD_START_SEARCH, crowd(300), sender(kClientA), running.callback());
        ASSERT_TRUE(running.waitReplies(2));
        ReplyRecorder stopReplies;
        plugin.Request(stopCommand, QVariant(), sender(kClientB), stopReplies.callback());
        EXPECT_FALSE(running.last().final);
        plugin.Request(stopCommand, QVariant(), sender(kClientA), stopReplies.callback());
        EXPECT_TRUE(running.waitFinal());
        EXPECT_LT(running.replies().size(), 202u) << qPrintable(stopCommand);
        EXPECT_TRUE(stopReplies.replies().empty());
    }
}
