// The query scheduler with its real worker and thread over an in-memory store: order of
// searches, cancelling queued ones, stopping the running one, and going away while busy.
#include "AttributeRetriever.h"
#include "DelvixKeys.h"
#include "fakes/FakeTamsaWrapper.h"
#include "fakes/SearchRecorder.h"

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <thread>

namespace {

int g_clientA = 0;
int g_clientB = 0;
void* const kClientA = &g_clientA;
void* const kClientB = &g_clientB;

// Stands in for a store with many matching objects that takes its time over each.
std::shared_ptr<FakeTamsaWrapper> slowStore(int objects, int delayMs)
{
    auto store = std::make_shared<FakeTamsaWrapper>();
    for (int i = 0; i < objects; ++i) {
        FakeObject object;
        object.id = uint64_t(i);
        object.location = 1;
        store->objects.push_back(object);
    }
    store->nextDelayMs = delayMs;
    return store;
}

QVariantMap request()
{
    return {{KEY_LOC_ID_LIST, QStringList{QStringLiteral("Loc1")}}};
}

// A one-shot gate a callback can wait at while the test acts.
class Gate
{
public:
    void open()
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        m_open = true;
        m_changed.notify_all();
    }
    bool wait(int timeoutMs = 10000)
    {
        std::unique_lock<std::mutex> lock(m_mutex);
        return m_changed.wait_for(lock, std::chrono::milliseconds(timeoutMs), [this] { return m_open; });
    }

private:
    std::mutex m_mutex;
    std::condition_variable m_changed;
    bool m_open = false;
};

class RetrieverTest : public ::testing::Test
{
protected:
    void useStore(std::shared_ptr<FakeTamsaWrapper> fake)
    {
        store = std::move(fake);
        auto worker = std::make_shared<AttributeQueryWorker>();
        worker->setTamsa(store);
        retriever->setAttributeRetriever(worker);
    }

    std::unique_ptr<AttributeRetriever> retriever = std::make_unique<AttributeRetriever>();
    std::shared_ptr<FakeTamsaWrapper> store;
};

} // namespace

TEST_F(RetrieverTest, SearchesRunOneAfterAnotherInArrivalOrder)
{
    useStore(slowStore(5, 2));
    SearchRecorder first;
    SearchRecorder second;
    SearchRecorder third;
    std::atomic<bool> firstDone{false};
    std::atomic<bool> secondStartedEarly{false};
    first.onCall = [&](bool finished, const QVariantMap&) { firstDone = firstDone || finished; };
    second.onCall = [&](bool, const QVariantMap&) { secondStartedEarly = secondStartedEarly || !firstDone; };
    retriever->query(kClientA, request(), first.callback());
    retriever->query(kClientB, request(), second.callback());
    // A null identifier is a search like any other and must not start a second thread.
    retriever->reId(nullptr, request(), third.callback());
    EXPECT_TRUE(third.waitFinished());
    EXPECT_TRUE(first.endsWithOneEmptyFinal());
    EXPECT_TRUE(second.endsWithOneEmptyFinal());
    EXPECT_EQ(first.hits().size(), 5u);
    EXPECT_EQ(second.hits().size(), 5u);
    EXPECT_FALSE(secondStartedEarly);
    EXPECT_EQ(store->maxOpenSearches(), 1);
    EXPECT_FALSE(retriever->hasNextTask());
}

TEST_F(RetrieverTest, NullIdentifiersNeverRunSideBySide)
{
    useStore(slowStore(3, 3));
    std::vector<std::unique_ptr<SearchRecorder>> recorders;
    for (int i = 0; i < 4; ++i) {
        recorders.push_back(std::make_unique<SearchRecorder>());
        retriever->query(nullptr, request(), recorders.back()->callback());
    }
    // A stop for no query stops nothing.
    retriever->stop(nullptr);
    for (auto& recorder : recorders) {
        EXPECT_TRUE(recorder->waitFinished());
        EXPECT_EQ(recorder->hits().size(), 3u);
    }
    EXPECT_EQ(store->maxOpenSearches(), 1);
}

TEST_F(RetrieverTest, StopCancelsAQueuedSearchAtOnce)
{
    useStore(slowStore(40, 0));
    Gate firstHit;
    Gate proceed;
    SearchRecorder running;
    running.onCall = [&](bool finished, const QVariantMap& record) {
        if (!finished && record.value(KEY_OBJECT_ID).toULongLong() == 0) {
            firstHit.open();
            proceed.wait();
        }
    };
    SearchRecorder queued;
    retriever->query(kClientA, request(), running.callback());
    ASSERT_TRUE(firstHit.wait());
    retriever->query(kClientB, request(), queued.callback());
    EXPECT_TRUE(retriever->hasNextTask());
    retriever->stop(kClientB);
    // Answered on the stopping thread while the running search is still under way.
    EXPECT_TRUE(queued.endsWithOneEmptyFinal());
    EXPECT_EQ(queued.calls().front().thread, std::this_thread::get_id());
    EXPECT_FALSE(retriever->hasNextTask());
    proceed.open();
    EXPECT_TRUE(running.waitFinished());
    EXPECT_EQ(running.hits().size(), 40u);
    EXPECT_EQ(store->firstCount(), 1);
    // A stop for a search that is neither queued nor running does nothing.
    retriever->stop(kClientB);
    EXPECT_EQ(queued.finals(), 1);
}

TEST_F(RetrieverTest, StopEndsTheRunningSearchAndTheNextOneStarts)
{
    useStore(slowStore(1000, 0));
    Gate secondHit;
    Gate proceed;
    SearchRecorder running;
    running.onCall = [&](bool finished, const QVariantMap& record) {
        if (!finished && record.value(KEY_OBJECT_ID).toULongLong() == 1) {
            secondHit.open();
            proceed.wait();
        }
    };
    SearchRecorder sameClient;
    SearchRecorder otherClient;
    retriever->query(kClientA, request(), running.callback());
    ASSERT_TRUE(secondHit.wait());
    // A new search of the running client waits behind it; the running one goes on.
    retriever->query(kClientA, request(), sameClient.callback());
    retriever->query(kClientB, request(), otherClient.callback());
    retriever->stop(kClientA);
    proceed.open();
    EXPECT_TRUE(running.waitFinished());
    // Ended at the next check after the stop.
    EXPECT_EQ(running.hits().size(), 2u);
    EXPECT_TRUE(running.endsWithOneEmptyFinal());
    // The queued search of the same client was not cancelled: it runs next, in full, then
    // the other client's.
    EXPECT_TRUE(sameClient.waitFinished());
    EXPECT_EQ(sameClient.hits().size(), 201u);
    EXPECT_TRUE(otherClient.waitFinished());
    EXPECT_EQ(otherClient.hits().size(), 201u);
}

TEST_F(RetrieverTest, LateStopNeverEndsTheFollowingSearch)
{
    // The window: the first search has cleared its stop flag and is making its final call,
    // while the scheduler still names it current. A stop of that client decided now is meant
    // for the first search and must not reach the second, queued under the same client.
    useStore(slowStore(5, 0));
    Gate finalEntered;
    Gate proceed;
    SearchRecorder first;
    first.onCall = [&](bool finished, const QVariantMap&) {
        if (finished) {
            finalEntered.open();
            proceed.wait();
        }
    };
    SearchRecorder second;
    retriever->query(kClientA, request(), first.callback());
    retriever->query(kClientA, request(), second.callback());
    ASSERT_TRUE(finalEntered.wait());
    retriever->stop(kClientA);
    proceed.open();
    EXPECT_TRUE(second.waitFinished());
    EXPECT_EQ(second.hits().size(), 5u);
    EXPECT_EQ(first.hits().size(), 5u);
}

TEST_F(RetrieverTest, SearchStartedWhileTheThreadEndsStillRuns)
{
    useStore(slowStore(1, 0));
    for (int round = 0; round < 200; ++round) {
        SearchRecorder recorder;
        retriever->query(round % 2 ? kClientA : kClientB, request(), recorder.callback());
        ASSERT_TRUE(recorder.waitFinished(5000)) << "round " << round;
        EXPECT_EQ(recorder.hits().size(), 1u);
    }
}

TEST_F(RetrieverTest, DestructionCancelsQueuedStopsRunningAndWaits)
{
    useStore(slowStore(100000, 2));
    SearchRecorder running;
    SearchRecorder queuedA;
    SearchRecorder queuedB;
    retriever->query(kClientA, request(), running.callback());
    ASSERT_TRUE(running.waitHits(1));
    retriever->reId(kClientB, request(), queuedA.callback());
    retriever->query(kClientB, request(), queuedB.callback());

    retriever.reset();
    // Once the scheduler is gone, every search has had its one final call and nothing of
    // it is left running.
    EXPECT_TRUE(running.endsWithOneEmptyFinal());
    EXPECT_TRUE(queuedA.endsWithOneEmptyFinal());
    EXPECT_TRUE(queuedB.endsWithOneEmptyFinal());
    EXPECT_TRUE(queuedA.hits().empty());
    EXPECT_EQ(store->openSearches(), 0);
    EXPECT_EQ(store->firstCount(), 1);
    const std::size_t calls = running.calls().size();
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    EXPECT_EQ(running.calls().size(), calls);
}

TEST_F(RetrieverTest, DestroyedFromItsOwnCallback)
{
    // The last owner lets go inside a search's final call, on the scheduler's own thread.
    useStore(slowStore(3, 0));
    std::weak_ptr<AttributeQueryWorker> worker;
    {
        auto owned = std::make_shared<AttributeQueryWorker>();
        owned->setTamsa(store);
        retriever->setAttributeRetriever(owned);
        worker = owned;
    }
    AttributeRetriever* scheduler = retriever.release();
    Gate firstHit;
    Gate proceed;
    SearchRecorder first;
    first.onCall = [&, scheduler](bool finished, const QVariantMap&) {
        if (!finished) {
            firstHit.open();
            proceed.wait();
        } else {
            delete scheduler;
        }
    };
    SearchRecorder queued;
    scheduler->query(kClientA, request(), first.callback());
    ASSERT_TRUE(firstHit.wait());
    scheduler->query(kClientB, request(), queued.callback());
    proceed.open();
    EXPECT_TRUE(first.waitFinished());
    EXPECT_TRUE(queued.waitFinished());
    EXPECT_TRUE(queued.endsWithOneEmptyFinal());
    EXPECT_TRUE(queued.hits().empty());
    EXPECT_EQ(first.hits().size(), 3u);
    EXPECT_EQ(store->firstCount(), 1);
    // The thread lets go of the worker on its way out; wait for that before the test ends.
    for (int i = 0; i < 5000 && !worker.expired(); ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    EXPECT_TRUE(worker.expired());
}
