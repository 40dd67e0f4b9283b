// Request dispatch of the plug-in object: refusals, the blocking entry points, traces, and
// replies from concurrent request threads.

#include "PluginDelvixSrv.h"
#include "DelvixKeys.h"
#include "FakeWemlo.h"
#include "LogFacility.h"

#include <QMutex>
#include <QThread>
#include <gtest/gtest.h>
#include <thread>
#include <vector>

namespace {

struct Reply
{
    bool bFinal = false;
    QString strCode;
    QString strMessage;
    QVariant payload;
};

// Collects replies from any thread.
class ReplyRecorder
{
public:
    HDLR_DO_REQUEST_CB callback()
    {
        return
            [this](bool bFinal, const QString& strCode, const QString& strMessage, const QVariant& payload) {
                QMutexLocker lock(&m_mutex);
                m_replies.push_back({bFinal, strCode, strMessage, payload});
            };
    }
    std::vector<Reply> replies()
    {
        QMutexLocker lock(&m_mutex);
        return m_replies;
    }

private:
    QMutex m_mutex;
    std::vector<Reply> m_replies; // guarded by m_mutex
};

// A responser that fails the test when anything is written to it.
class StrictResponser : public IResponser
{
public:
    void Respond(const QString&, const QString&, const QVariant&) override
    {
        ADD_FAILURE() << "the responser must not be used";
    }
};

void expectOneRefusal(PluginDelvixSrv& plugin, const QString& strCommand)
{
    ReplyRecorder recorder;
    plugin.Request(strCommand, QVariantMap{{QStringLiteral("a"), 1}}, RequestSenderInfo{},
                   recorder.callback());
    const std::vector<Reply> replies = recorder.replies();
    ASSERT_EQ(replies.size(), 1u) << qPrintable(strCommand);
    EXPECT_TRUE(replies[0].bFinal);
    EXPECT_EQ(replies[0].strCode, QStringLiteral("commandNotSupportError"));
    EXPECT_TRUE(replies[0].strMessage.isEmpty());
    EXPECT_FALSE(replies[0].payload.isValid());
}

} // namespace

TEST(PluginDelvixSrvDispatch, UnknownEmptyAndMiscasedCommandsAreRefusedOnce)
{
    PluginDelvixSrv plugin;
    expectOneRefusal(plugin, QStringLiteral("noSuchCommand"));
    expectOneRefusal(plugin, QString());
    expectOneRefusal(plugin, QStringLiteral("StartSearch"));
    expectOneRefusal(plugin, QStringLiteral("GETCASELIST"));
    expectOneRefusal(plugin, QStringLiteral("startSearch "));
    // Text from outside never becomes a format.
    expectOneRefusal(plugin, QStringLiteral("%s%s%s%n"));
}

TEST(PluginDelvixSrvDispatch, BlockingEntryPointsNeverTouchTheResponser)
{
    PluginDelvixSrv plugin;
    StrictResponser responser;
    plugin.RequestBlock(CMD_GET_CASE_LIST, QVariant(), RequestSenderInfo{}, responser);
    plugin.SubscribeEventBlock(QStringLiteral("event"), QStringLiteral("filter"), QVariant(),
                               RequestSenderInfo{}, responser);
    plugin.UnsubscribeEventBlock(QStringLiteral("event"), QVariant(), responser);
}

TEST(PluginDelvixSrvDispatch, EntryPointsAreTracedInPairs)
{
    fakeWemloReset();
    LogFacility::reload(FAKE_WEMLO_PATH);
    {
        PluginDelvixSrv plugin;
        StrictResponser responser;
        ReplyRecorder recorder;
        plugin.Request(QStringLiteral("nope"), QVariant(), RequestSenderInfo{}, recorder.callback());
        plugin.RequestBlock(QString(), QVariant(), RequestSenderInfo{}, responser);
        plugin.SubscribeEventBlock(QString(), QString(), QVariant(), RequestSenderInfo{}, responser);
        plugin.UnsubscribeEventBlock(QString(), QVariant(), responser);
    }
    std::vector<std::string> texts;
    for (const FakeWemloLine& line : fakeWemloState().lines) {
        texts.push_back(line.text);
    }
    EXPECT_EQ(texts, (std::vector<std::string>{
                         "PluginDelvixSrv::Request, Enter",
                         "PluginDelvixSrv::Request, Leave",
                         "PluginDelvixSrv::RequestBlock, Enter",
                         "PluginDelvixSrv::RequestBlock, Leave",
                         "PluginDelvixSrv::SubscribeEventBlock, Enter",
                         "PluginDelvixSrv::SubscribeEventBlock, Leave",
                         "PluginDelvixSrv::UnsubscribeEventBlock, Enter",
                         "PluginDelvixSrv::UnsubscribeEventBlock, Leave",
                         "PluginDelvixSrv::~PluginDelvixSrv, Enter",
                         "PluginDelvixSrv::~PluginDelvixSrv, Leave",
                     }));
    fakeWemloReset();
}

TEST(PluginDelvixSrvDispatch, ConcurrentRequestsEachGetTheirOwnReply)
{
    PluginDelvixSrv plugin;
    constexpr int kThreads = 8;
    constexpr int kRequestsPerThread = 200;
    std::vector<ReplyRecorder> recorders(kThreads);
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&plugin, &recorders, t]() {
            for (int i = 0; i < kRequestsPerThread; ++i) {
                plugin.Request(QStringLiteral("unknown%1").arg(i), QVariant(i), RequestSenderInfo{},
                               recorders[t].callback());
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    for (ReplyRecorder& recorder : recorders) {
        const std::vector<Reply> replies = recorder.replies();
        ASSERT_EQ(replies.size(), size_t(kRequestsPerThread));
        for (const Reply& reply : replies) {
            EXPECT_EQ(reply.strCode, QStringLiteral("commandNotSupportError"));
        }
    }
}

TEST(PluginDelvixSrvDispatch, PluginWorksWithoutLoggingLibrary)
{
    LogFacility::reload("/nonexistent/libWemloLogUtl.so");
    PluginDelvixSrv plugin;
    EXPECT_TRUE(plugin.InitialPluginBase(nullptr));
    plugin.AllPluginLoaded();
    expectOneRefusal(plugin, QStringLiteral("noSuchCommand"));
}
