// Attribute and re-identification search over a real store holding a few hand-made objects: which
// requests find which objects with which fields, failures and stops of the worker, the scheduler's
// order and stops, and the stop commands through Request.
#include "AttributeRetriever.h"
#include "DelvixKeys.h"
#include "HostFakes.h"
#include "PluginDelvixSrv.h"
#include "ReplyRecorder.h"
#include "SearchStore.h"
#include "StoreFixture.h"

#include <QJsonDocument>
#include <QJsonObject>
#include <gtest/gtest.h>

#include <cmath>
#include <thread>

namespace {

constexpr uint32_t T = 1700000000; // seconds
int g_clients[2];
void* const kA = &g_clients[0];
void* const kB = &g_clients[1];
using Ids = std::vector<qulonglong>;

// 512 floats along one axis: vectors of different axes score 0, of one axis 1.
std::vector<float> axis(int index)
{
    std::vector<float> vector(512);
    vector[size_t(index)] = 1;
    return vector;
}
const auto axisList = [](int index) {
    const auto vector = axis(index);
    return QVariantList(vector.begin(), vector.end());
};
const auto here = [] { return QString::number(quintptr(QThread::currentThreadId())); };

// The worker's callback into a reply recorder: payload the record, message the calling thread.
class Hits : public ReplyRecorder
{
public:
    std::function<bool(bool, const QVariantMap&)> before = [](bool, const QVariantMap&) { return false; };
    std::atomic<bool> paused{false}, proceed{false}; // `before` true: pause there until `proceed`
    AttributeQueryWorker::Callback worker()
    {
        return [this, reply = callback()](bool finished, const QVariantMap& record) {
            before(finished, record) && (paused = true, waitFor([this] { return proceed.load(); }));
            reply(finished, QString(), here(), record);
        };
    }
    Ids ids() const
    {
        Ids ids;
        for (const QVariant& hit : progress()) {
            ids.push_back(hit.toMap().value(KEY_OBJECT_ID).toULongLong());
        }
        return ids;
    }
    // Exactly one final call, the last, with an empty record.
    bool endedOnce() const { return finalCount() == 1 && last().final && last().payload.toMap().isEmpty(); }
};

QVariantMap request(const QVariantMap& extra = {}, const QStringList& locations = {"Loc1"})
{
    QVariantMap params{{"locIDList", locations},
                       {"startTimestamp", qulonglong(T) * 1000},
                       {"endTimestamp", qulonglong(T + 3600) * 1000}};
    params.insert(extra);
    return params;
}

// The first `count` of the 300 people at Loc3, one a second from T + 1000.
QVariantMap crowd(int count)
{
    return request({{"startTimestamp", qulonglong(T + 1000) * 1000},
                    {"endTimestamp", qulonglong(T + 999 + count) * 1000}},
                   {"Loc3"});
}

class SearchTest : public storetest::StoreFixture
{
protected:
    // Loc1: person 1 walks through the zone and across the line x = 0.5, person 2 stays in the
    // zone, vehicle 3 has a plate, 9 is outside the hour. Loc2: person 4, the body of person 1.
    // Loc3: 300 people without vectors, one a second from T + 1000.
    void SetUp() override
    {
        StoreFixture::SetUp();
        // clang-format off
        ASSERT_EQ(put(1, {
            {1, "Human", T + 10, T + 20, R"({"Age":"adult","Gender":1,"Accessories":[1],"UpperColor":[2,3],"LowerColor":[4]})",
             {{0.1, 0.5}, {0.4, 0.5}, {0.6, 0.5}, {0.9, 0.5}}, axis(0), axis(1)},
            {2, "Human", T + 30, T + 100, R"({"Gender":2,"UpperColor":[5]})", {{0.45, 0.45}, {0.46, 0.5}, {0.45, 0.55}},
             axis(2), axis(3), true},
            {3, "Vehicle", T + 50, T + 60, R"({"Type":1,"Color":[4],"PlateNumber":"AB123"})", {{0.9, 0.9}}, {}, {}, false, "AB123"},
            {9, "Human", T + 5000, T + 5001}}), 4);
        // clang-format on
        ASSERT_EQ(put(2, {{4, "Human", T + 15, T + 16, R"({"Gender":1})", {}, axis(0)}}), 1);
        std::vector<storetest::ObjectSpec> people;
        for (uint32_t i = 0; i < 300; ++i) {
            people.push_back({100 + i, "Human", T + 1000 + i, T + 1000 + i});
        }
        ASSERT_EQ(put(3, people), 300);
        worker->setTamsa(store);
        retriever->setAttributeRetriever(worker);
    }

    Ids find(const QVariantMap& params)
    {
        Hits hits;
        worker->query(params, hits.worker());
        EXPECT_TRUE(hits.endedOnce());
        return hits.ids();
    }

    std::shared_ptr<SearchStore> store = std::make_shared<SearchStore>(storagePath());
    std::shared_ptr<AttributeQueryWorker> worker = std::make_shared<AttributeQueryWorker>();
    std::unique_ptr<AttributeRetriever> retriever = std::make_unique<AttributeRetriever>();
};

} // namespace

TEST_F(SearchTest, RequestsFindTheirObjects)
{
    const auto rule = [](const QString& type, const char* trace, int direction) {
        return QVariantMap{
            {"ruleInfo",
             QVariantMap{{"type", type}, {"trace", trace}, {"duration", 30}, {"direction", direction}}}};
    };
    const char* const zone = "[[0.3,0.3],[0.7,0.3],[0.7,0.7],[0.3,0.7]]";
    const char* const line = "[[0.5,0],[0.5,1]]";
    // Milliseconds are cut to seconds: 20.999 s overlaps person 1, 29.999 s ends before person 2.
    const QVariantMap msWindow{{"startTimestamp", T * 1000ull + 20999},
                               {"endTimestamp", T * 1000ull + 29999}};
    const std::vector<std::tuple<const char*, QVariantMap, Ids>> rows{
        {"in time order", request(), {1, 2, 3}},
        {"two locations merged by time", request({}, {"Loc1", "", "Loc2"}), {1, 4, 2, 3}},
        {"unsorted: location by location", request({{"doNotSort", true}}, {"Loc2", "Loc1"}), {4, 1, 2, 3}},
        {"descending", request({{"descending", true}}), {3, 2, 1}},
        {"ms window", request(msWindow), {1}},
        {"end beyond 32 bits", request({{"endTimestamp", (1ull << 32) * 1000 + 5000}}), {1, 2, 3, 9}},
        {"start before the epoch", request({{"startTimestamp", -1}}), {1, 2, 3}},
        {"end before the epoch", request({{"endTimestamp", -5000}}), {}},
        {"primary person attribute", request({{"humanInfo", R"({"Gender":1})"}}, {"Loc1", "Loc2"}), {1, 4}},
        {"other person attribute", request({{"humanInfo", R"({"UpperColor":[5]})"}}), {2}},
        {"both kinds must hold", request({{"humanInfo", R"({"Gender":1,"UpperColor":[5]})"}}), {}},
        {"vehicle", request({{"vehicleInfo", R"({"Type":1,"Color":[4],"PlateNumber":"AB1"})"}}), {3}},
        {"plate pattern", request({{"plateNumber", "ab*"}}), {3}},
        {"intrusion", request(rule("intrusion", zone, 0)), {1, 2}},
        {"loitering", request(rule(KEY_LOITERING, zone, 0)), {2}},
        {"line crossed positive to negative", request(rule(KEY_LINE_CROSSING, line, 2)), {1}},
        {"line not crossed the other way", request(rule(KEY_LINE_CROSSING, line, 1)), {}},
        {"a direction counts only for a line", request(rule("intrusion", line, 1)), {1}},
        {"body vector", request({{"feature", axisList(0)}}), {1}},
        {"face vector", request({{"faceFeature", axisList(1)}}), {1}},
    };
    for (const auto& [name, params, expected] : rows) {
        EXPECT_EQ(find(params), expected) << name;
    }
}

TEST_F(SearchTest, HitsCarryTheStoredFields)
{
    Hits hits;
    worker->query(request(), hits.worker());
    QByteArrayList texts;  // each hit as compact JSON, its vectors as the axis they lie on
    for (int i : {0, 2}) { // the person with a face crop and the vehicle
        QVariantMap map = hits.progress().at(i).toMap();
        for (const QString& key : {KEY_FEATURE, KEY_FACE_FEATURE}) {
            map.contains(key) ? void(map[key] = map[key].toList().indexOf(QVariant(1))) : void();
        }
        texts << QJsonDocument(QJsonObject::fromVariantMap(map)).toJson(QJsonDocument::Compact);
    }
    EXPECT_EQ(
        texts.join('\n').toStdString(),
        R"({"endTimestamp":1700000020000,"faceFeature":1,"faceImage":"ZmFjZQ","feature":0,"locID":"Loc1",)"
        R"("objImage":"aW1hZ2U1","objType":"Human","objectAccessories":[1],"objectAge":"adult",)"
        R"("objectGender":1,"objectID":1,"objectLowerColor":[4],"objectUpperColor":[2,3],)"
        R"("objectVehicleColor":[],"objectVehicleType":"","startTimestamp":1700000010000,"trajectory":)"
        R"([{"x":0.1,"y":0.5},{"x":0.4,"y":0.5},{"x":0.6,"y":0.5},{"x":0.9,"y":0.5}]})"
        "\n"
        R"({"endTimestamp":1700000060000,"feature":-1,"locID":"Loc1","objImage":"aW1hZ2U3","objType":"Vehicle",)"
        R"("objectAccessories":[],"objectAge":"","objectGender":"","objectID":3,"objectLowerColor":[],)"
        R"("objectUpperColor":[],"objectVehicleColor":[4],"objectVehicleType":1,"plateImage":"cGxhdGU",)"
        R"("plateNumber":"AB123","startTimestamp":1700000050000,"trajectory":[{"x":0.9,"y":0.9}]})");
}

TEST_F(SearchTest, AtMost201HitsAndFailuresAndStopsEndWithTheFinalCallOnly)
{
    Hits many;
    worker->query(crowd(300), many.worker());
    EXPECT_EQ(QString("%1 %2 %3").arg(many.ids().size()).arg(many.ids().back()).arg(many.endedOnce()),
              "201 300 1");
    EXPECT_EQ(store->counts(), "firsts 1 opens 1 closes 1 releases 1 aborts 0 stale 0");
    store->firstStatus = TAMSA_E_BAD_QUERY; // nothing is opened, nothing closed
    EXPECT_EQ(find(crowd(3)), Ids{});
    EXPECT_EQ(store->counts(), "firsts 2 opens 1 closes 1 releases 2 aborts 0 stale 0");
    // A failing initialisation is only logged; a failing Next keeps the hits so far.
    store->firstStatus = 0;
    store->initStatus = TAMSA_E_NO_STORAGE_PATH;
    store->failNextAfter = 2;
    EXPECT_EQ(find(crowd(5)), (Ids{100, 101}));
    EXPECT_EQ(store->counts(), "firsts 3 opens 2 closes 2 releases 3 aborts 0 stale 0");
    // A stop before the search begins ends it with no hits, and is then used up.
    store->failNextAfter = -1;
    const quint64 first = worker->searchGeneration();
    EXPECT_TRUE(worker->stop(first) && find(crowd(50)).empty() && !worker->stop(first) &&
                find(crowd(50)).size() == 50u);
}

TEST_F(SearchTest, ReIdSearchesEveryLocationOnItsOwn)
{
    // An empty entry leaves no location: no store search for it, the others go on. The person
    // conditions do not count; scores are as the store gave them.
    const QVariantMap params =
        request({{"feature", axisList(0)}, {"faceFeature", axisList(1)}, {"humanInfo", R"({"Gender":2})"}},
                {"Loc2", "", "Loc1", "Loc3"});
    worker->setParallel(false);
    Hits serial;
    worker->reId(params, serial.worker());
    ASSERT_EQ(serial.ids(), (Ids{4, 1})); // in list order
    const QVariantMap person = serial.progress()[1].toMap();
    EXPECT_EQ(QVariantList({serial.endedOnce(), serial.replies().front().message == here(),
                            int(store->firsts), person.value(KEY_SCORE), person.value(KEY_FACE_SCORE)}),
              QVariantList({true, true, 3, 1.0f, 1.0f}));
    // Parallel: the hits from the pool's threads, the final call on the caller's after all of them.
    worker->setParallel(true);
    worker->setPeriods(3);
    Hits parallel;
    worker->reId(params, parallel.worker());
    EXPECT_EQ(QVariantList({int(parallel.ids().size()), parallel.endedOnce(),
                            parallel.replies().front().message == here(), parallel.last().message == here()}),
              QVariantList({2, true, false, true}));
    // Every search is off the stop list once it is closed.
    worker->stop();
    EXPECT_EQ(store->staleAborts + store->opens - store->closes, 0);
}

TEST_F(SearchTest, StopDuringReIdEndsEveryLocation)
{
    store->holdUntilAbort = true;
    worker->setPeriods(3);
    Hits held;
    std::thread search([&] { worker->reId(request({}, {"Loc1", "Loc2", "Loc3"}), held.worker()); });
    EXPECT_TRUE(waitFor([&] { return store->held == 3; }));
    worker->stop();
    search.join();
    EXPECT_EQ(QVariantList({held.endedOnce(), int(held.ids().size()), int(store->aborts), int(store->closes),
                            int(store->staleAborts)}),
              QVariantList({true, 0, 3, 3, 0}));
}

TEST_F(SearchTest, ScoresAndZones)
{
    const float nan = std::nanf("");
    // The candidate's tail is ignored, a short candidate, NaN or infinity scores 0, never negative.
    const std::vector<std::tuple<std::vector<float>, QVariantList, float>> rows{
        {{3, 4}, {4, 3}, 0.96f}, {{1, 0}, {1, 0, 5}, 1},     {{1, 1}, {1}, 0},
        {{0, 0}, {0, 0}, 1},     {{0, 0}, {1, 0}, 0},        {{1, 0}, {-1, 0}, 0},
        {{1, 0}, {nan, 0}, 0},   {{INFINITY, 1}, {1, 1}, 0}, {{1, 1}, {"x", 1}, std::sqrt(0.5f)}};
    for (const auto& [a, b, score] : rows) {
        EXPECT_NEAR(worker->getScore(a, b, int(a.size())), score, 1e-6) << b.size();
    }
    // The standard bias in quarter hours from 48, truncated toward zero.
    EXPECT_EQ(std::vector<int>({AttributeQueryWorker::makeTZDS(-480, false).wZone,
                                AttributeQueryWorker::makeTZDS(-330, true).wZone,
                                AttributeQueryWorker::makeTZDS(300, true).wDaylight}),
              std::vector<int>({16, 26, 1}));
}

// ---- the scheduler: one search at a time, in arrival order ----------------------------------

TEST_F(SearchTest, QueuedSearchesRunInOrderAndStopsReachTheirOwn)
{
    Hits running, anonymous, sameClient, cancelled;
    running.before = [](bool finished, const QVariantMap& hit) {
        return !finished && hit.value(KEY_OBJECT_ID) == 101;
    };
    std::atomic<bool> early{false};
    anonymous.before = [&](bool, const QVariantMap&) {
        return (early = early || !running.finalCount()), false;
    };
    sameClient.before = [&](bool, const QVariantMap&) {
        return (early = early || !anonymous.finalCount()), false;
    };
    retriever->query(kA, crowd(300), running.worker());
    ASSERT_TRUE(waitFor([&] { return running.paused.load(); }));
    // A null identifier is a search like any other, and a stop for it stops nothing.
    retriever->query(nullptr, crowd(5), anonymous.worker());
    retriever->query(kA, crowd(300), sameClient.worker());
    retriever->reId(kB, crowd(300), cancelled.worker());
    retriever->stop(nullptr);
    // A queued search is answered at once, on the stopping thread.
    retriever->stop(kB);
    EXPECT_TRUE(cancelled.endedOnce() && cancelled.last().message == here());
    // The running search ends at its next check; the queued one of the same client runs in full.
    retriever->stop(kA);
    running.proceed = true;
    EXPECT_TRUE(sameClient.waitFinal());
    EXPECT_EQ(QVariantList({int(running.ids().size()), running.endedOnce(), int(anonymous.ids().size()),
                            int(sameClient.ids().size()), early.load(), int(store->firsts)}),
              QVariantList({2, true, 5, 201, false, 3}));
}

TEST_F(SearchTest, LateStopsAndStartsReachOnlyTheirOwnSearch)
{
    // The first search has cleared its stop flag and makes its final call while the scheduler
    // still names it current: a stop decided now is meant for it, not for the next one.
    Hits first, second;
    first.before = [](bool finished, const QVariantMap&) { return finished; };
    retriever->query(kA, crowd(5), first.worker());
    retriever->query(kA, crowd(5), second.worker());
    ASSERT_TRUE(waitFor([&] { return first.paused.load(); }));
    retriever->stop(kA);
    first.proceed = true;
    EXPECT_TRUE(second.waitFinal() && second.ids().size() == 5u);
    // A search queued just as the scheduler's thread runs out of work still runs.
    for (int round = 0; round < 200; ++round) {
        Hits hits;
        retriever->query(round % 2 ? kA : kB, crowd(1), hits.worker());
        ASSERT_TRUE(hits.waitFinal(5000) && hits.ids().size() == 1u) << "round " << round;
    }
}

TEST_F(SearchTest, SchedulerDestructionCancelsQueuedStopsRunningAndWaits)
{
    store->nextDelayMs = 2;
    Hits running, queued;
    retriever->query(kA, crowd(300), running.worker());
    ASSERT_TRUE(waitFor([&] { return !running.progress().empty(); }));
    retriever->reId(kB, crowd(300), queued.worker());
    retriever.reset();
    // Once the scheduler is gone every search has had its one final call and nothing of it runs.
    EXPECT_TRUE(running.endedOnce() && queued.endedOnce() && queued.ids().empty());
    EXPECT_EQ(QVariantList({int(store->firsts), store->opens - store->closes}), QVariantList({1, 0}));
}

TEST_F(SearchTest, SchedulerDestroyedFromItsOwnCallback)
{
    // The last owner lets go inside a search's final call, on the scheduler's own thread.
    std::weak_ptr<AttributeQueryWorker> owned = worker;
    worker.reset();
    AttributeRetriever* scheduler = retriever.release();
    Hits first, queued;
    first.before = [&, scheduler](bool finished, const QVariantMap&) {
        finished ? delete scheduler : void();
        return !finished && first.progress().empty();
    };
    scheduler->query(kA, crowd(3), first.worker());
    ASSERT_TRUE(waitFor([&] { return first.paused.load(); }));
    scheduler->query(kB, crowd(3), queued.worker());
    first.proceed = true;
    EXPECT_TRUE(queued.waitFinal() && queued.endedOnce() && queued.ids().empty());
    EXPECT_EQ(QVariantList({int(first.ids().size()), int(store->firsts)}), QVariantList({3, 1}));
    EXPECT_TRUE(waitFor([&] { return owned.expired(); })); // the thread lets go of the worker
}

TEST_F(SearchTest, StopCommandsStopOnlyTheClientsSearch)
{
    PluginDelvixSrv plugin;
    plugin.setAttributeRetriever(QSharedPointer<AttributeRetriever>(retriever.release()));
    plugin.setCameraInformationCollector(QSharedPointer<FakeCollector>::create());
    plugin.InitialPluginBase(nullptr);
    RequestSenderInfo a, b;
    a.senderHandle = kA, b.senderHandle = kB;
    store->nextDelayMs = 10; // a search of some seconds unless stopped
    for (const QString& stop : {CMD_STOP_SEARCH, CMD_STOP_REID_SEARCH}) {
        ReplyRecorder running, stopReplies;
        plugin.Request(CMD_START_SEARCH, crowd(300), a, running.callback());
        ASSERT_TRUE(waitFor([&] { return running.replies().size() >= 2; }));
        plugin.Request(stop, QVariant(), b, stopReplies.callback());
        EXPECT_FALSE(running.last().final);
        plugin.Request(stop, QVariant(), a, stopReplies.callback());
        EXPECT_TRUE(running.waitFinal());
        EXPECT_EQ(QVariantList({running.replies().size() < 202, running.finalCount(),
                                int(stopReplies.replies().size())}),
                  QVariantList({true, 1, 0}))
            << qPrintable(stop);
    }
}
