// The four search commands through Request: the enable flag, the stream of replies with the
// camera of each hit, and the stop commands, over the real scheduler and an in-memory store.
#include "AttributeRetriever.h"
#include "DelvixKeys.h"
#include "ICameraInformationCollector.h"
#include "PluginDelvixSrv.h"
#include "fakes/FakeTamsaWrapper.h"

#include <gtest/gtest.h>

#include <QHash>

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <thread>

namespace {

int g_clientA = 0;
int g_clientB = 0;

class FakeCollector : public ICameraInformationCollector
{
public:
    void writeData(int, int, const QString&) override {}
    void setDelvixSettings(const QVariantMap& settings) override { lastSettings = settings; }
    QString getCameraNodeID(const QString& location) override { return cameras.value(location); }

    QHash<QString, QString> cameras; // location id -> camera name; fixed before searches
    QVariantMap lastSettings;
};

// Replies of one request, from any thread.
class ReplyRecorder
{
public:
    struct Reply
    {
        bool final;
        QString code;
        QString message;
        QVariant payload;
    };

    HDLR_DO_REQUEST_CB callback()
    {
        return [this](bool bFinal, const QString& code, const QString& message, const QVariant& payload) {
            std::lock_guard<std::mutex> lock(m_mutex);
            m_replies.push_back({bFinal, code, message, payload});
            m_changed.notify_all();
        };
    }
    bool waitFinal(int timeoutMs = 10000)
    {
        std::unique_lock<std::mutex> lock(m_mutex);
        return m_changed.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                                  [this] { return !m_replies.empty() && m_replies.back().final; });
    }
    bool waitReplies(std::size_t count, int timeoutMs = 10000)
    {
        std::unique_lock<std::mutex> lock(m_mutex);
        return m_changed.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                                  [&] { return m_replies.size() >= count; });
    }
    std::vector<Reply> replies() const
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        return m_replies;
    }

private:
    mutable std::mutex m_mutex;
    std::condition_variable m_changed;
    std::vector<Reply> m_replies;
};

// Hands out prepared hits at once, and notes the stops it gets.
class ScriptedRetriever : public AttributeRetriever
{
public:
    void query(QueryID const&, const QVariantMap&, const Callback& callback) override { play(callback); }
    void reId(QueryID const&, const QVariantMap&, const Callback& callback) override { play(callback); }
    void stop(QueryID const& id) override { stops.push_back(id); }

    std::vector<QVariantMap> hits;
    std::vector<QueryID> stops;

private:
    void play(const Callback& callback)
    {
        for (const QVariantMap& hit : hits) {
            callback(false, hit);
        }
        callback(true, QVariantMap());
    }
};

RequestSenderInfo sender(int* client)
{
    RequestSenderInfo info;
    info.senderHandle = client;
    return info;
}

class SearchCommandsTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        store = std::make_shared<FakeTamsaWrapper>();
        auto worker = std::make_shared<AttributeQueryWorker>();
        worker->setTamsa(store);
        auto retriever = QSharedPointer<AttributeRetriever>::create();
        retriever->setAttributeRetriever(worker);
        plugin.setAttributeRetriever(retriever);
        collector = QSharedPointer<FakeCollector>::create();
        collector->cameras.insert(QStringLiteral("Loc1"), QStringLiteral("camera-1"));
        plugin.setCameraInformationCollector(collector);
        plugin.InitialPluginBase(nullptr);
    }

    void addPeople(int count, uint32_t location, int delayMs = 0)
    {
        for (int i = 0; i < count; ++i) {
            FakeObject object;
            object.id = uint64_t(store->objects.size());
            object.location = location;
            object.score = 0.9f;
            store->objects.push_back(object);
        }
        store->nextDelayMs = delayMs;
    }

    static QVariantMap search(const QStringList& locations) { return {{KEY_LOC_ID_LIST, locations}}; }

    PluginDelvixSrv plugin;
    std::shared_ptr<FakeTamsaWrapper> store;
    QSharedPointer<FakeCollector> collector;
};

} // namespace

TEST_F(SearchCommandsTest, DisabledStartCommandsAnswerAtOnceAndSearchNothing)
{
    addPeople(3, 1);
    plugin.setEnableDelvix({{QStringLiteral("faceEnable"), true}}); // no "enable": off
    EXPECT_EQ(collector->lastSettings.value(QStringLiteral("faceEnable")), QVariant(true));
    for (const QString& command : {CMD_START_SEARCH, CMD_START_REID_SEARCH}) {
        ReplyRecorder replies;
        plugin.Request(command, search({"Loc1"}), sender(&g_clientA), replies.callback());
        ASSERT_EQ(replies.replies().size(), 1u) << qPrintable(command);
        const ReplyRecorder::Reply reply = replies.replies().front();
        EXPECT_TRUE(reply.final);
        EXPECT_EQ(reply.code, RC_SUCCESS);
        EXPECT_TRUE(reply.message.isEmpty());
        EXPECT_FALSE(reply.payload.isValid());
    }
    EXPECT_EQ(store->initCount(), 0);

    plugin.setEnableDelvix({{QStringLiteral("enable"), true}});
    ReplyRecorder replies;
    plugin.Request(CMD_START_SEARCH, search({"Loc1"}), sender(&g_clientA), replies.callback());
    EXPECT_TRUE(replies.waitFinal());
    EXPECT_EQ(replies.replies().size(), 4u);
}

TEST_F(SearchCommandsTest, HitsStreamWithTheirCameraThenTheFinalReply)
{
    addPeople(2, 1);
    addPeople(1, 2); // a location no camera carries
    for (const QString& command : {CMD_START_SEARCH, CMD_START_REID_SEARCH}) {
        ReplyRecorder replies;
        plugin.Request(command, search({"Loc1", "Loc2"}), sender(&g_clientA), replies.callback());
        ASSERT_TRUE(replies.waitFinal()) << qPrintable(command);
        const std::vector<ReplyRecorder::Reply> all = replies.replies();
        ASSERT_EQ(all.size(), 4u);
        std::map<QString, int> cameras;
        for (std::size_t i = 0; i < 3; ++i) {
            EXPECT_FALSE(all[i].final);
            EXPECT_EQ(all[i].code, RC_SUCCESS);
            const QVariantMap hit = all[i].payload.toMap();
            ++cameras[hit.value(KEY_NODE_ID).toString()];
            EXPECT_TRUE(hit.contains(KEY_OBJECT_ID));
        }
        EXPECT_EQ(cameras[QStringLiteral("camera-1")], 2);
        EXPECT_EQ(cameras[QString()], 1);
        EXPECT_TRUE(all.back().final);
        EXPECT_EQ(all.back().code, RC_SUCCESS);
        EXPECT_FALSE(all.back().payload.isValid());
    }
}

TEST_F(SearchCommandsTest, NodeIdIsAlwaysTheDirectorysAnswer)
{
    auto scripted = QSharedPointer<ScriptedRetriever>::create();
    scripted->hits = {{{KEY_LOC_ID, "Loc1"}, {KEY_NODE_ID, "stale"}},
                      {{KEY_LOC_ID, "Loc9"}, {KEY_NODE_ID, "stale"}}};
    plugin.setAttributeRetriever(scripted);
    ReplyRecorder replies;
    plugin.Request(CMD_START_SEARCH, QVariantMap(), sender(&g_clientA), replies.callback());
    ASSERT_EQ(replies.replies().size(), 3u);
    EXPECT_EQ(replies.replies()[0].payload.toMap().value(KEY_NODE_ID).toString(), "camera-1");
    EXPECT_EQ(replies.replies()[1].payload.toMap().value(KEY_NODE_ID).toString(), QString());

    // Without a camera directory every hit gets an empty camera.
    plugin.setCameraInformationCollector({});
    ReplyRecorder noDirectory;
    plugin.Request(CMD_START_REID_SEARCH, QVariantMap(), sender(&g_clientA), noDirectory.callback());
    ASSERT_EQ(noDirectory.replies().size(), 3u);
    EXPECT_TRUE(noDirectory.replies()[0].payload.toMap().contains(KEY_NODE_ID));
    EXPECT_EQ(noDirectory.replies()[0].payload.toMap().value(KEY_NODE_ID).toString(), QString());

    // Stop commands reach the scheduler under the client's handle.
    plugin.Request(CMD_STOP_SEARCH, QVariant(), sender(&g_clientB), ReplyRecorder().callback());
    plugin.Request(CMD_STOP_REID_SEARCH, QVariant(), sender(&g_clientA), ReplyRecorder().callback());
    EXPECT_EQ(scripted->stops, (std::vector<void*>{&g_clientB, &g_clientA}));
}

TEST_F(SearchCommandsTest, StopCommandsNeverReplyAndStopTheClientsSearch)
{
    addPeople(1000, 1, 10); // a search of some seconds unless stopped
    for (const QString& stopCommand : {CMD_STOP_SEARCH, CMD_STOP_REID_SEARCH}) {
        ReplyRecorder running;
        plugin.Request(CMD_START_SEARCH, search({"Loc1"}), sender(&g_clientA), running.callback());
        ASSERT_TRUE(running.waitReplies(2));
        // Another client's stop, and a stop of a client with no search, change nothing.
        ReplyRecorder stopReplies;
        plugin.Request(stopCommand, QVariant(), sender(&g_clientB), stopReplies.callback());
        EXPECT_FALSE(running.replies().back().final);
        plugin.Request(stopCommand, QVariant(), sender(&g_clientA), stopReplies.callback());
        EXPECT_TRUE(running.waitFinal());
        EXPECT_LT(running.replies().size(), 202u);
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
        EXPECT_TRUE(stopReplies.replies().empty()) << qPrintable(stopCommand);
    }
}
