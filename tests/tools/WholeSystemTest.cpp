// The whole system in one process, on real threads and loopback sockets: simulated cameras, the
// configuration server, the host and the loaded plug-in module. Metadata that travelled the
// whole road is found by a search with its camera, a case made from a hit gets its bookmark,
// and the plug-in unloads cleanly while a search is still running.

#include "PluginHost.h"
#include "SiteRunner.h"

#include <QCoreApplication>
#include <QDateTime>
#include <QDir>
#include <QElapsedTimer>
#include <QFile>
#include <QMutex>
#include <QTemporaryDir>
#include <QThread>
#include <gtest/gtest.h>

namespace {

struct Reply
{
    bool bFinal = false;
    QString strCode;
    QVariant payload;
};

class Recorder
{
public:
    HDLR_DO_REQUEST_CB callback()
    {
        return [this](bool bFinal, const QString& strCode, const QString&, const QVariant& payload) {
            QMutexLocker lock(&m_mutex);
            m_replies.push_back({bFinal, strCode, payload});
        };
    }
    QList<Reply> replies() const
    {
        QMutexLocker lock(&m_mutex);
        return m_replies;
    }
    int finals() const
    {
        // Counted under the lock: iterating a copy would detach it outside the lock while the
        // plug-in's thread appends, which leans on Qt's unsynchronised reference-count check.
        QMutexLocker lock(&m_mutex);
        int count = 0;
        for (const Reply& reply : m_replies) {
            count += reply.bFinal ? 1 : 0;
        }
        return count;
    }

private:
    mutable QMutex m_mutex;
    QList<Reply> m_replies; // guarded by m_mutex
};

template <typename Pred>
bool waitFor(Pred pred, int timeoutMs)
{
    QElapsedTimer timer;
    timer.start();
    while (!pred() && timer.elapsed() < timeoutMs) {
        QCoreApplication::processEvents(QEventLoop::AllEvents, 20);
        QThread::msleep(2);
    }
    return pred();
}

void writeFile(const QString& path, const QByteArray& content)
{
    QFile file(path);
    ASSERT_TRUE(file.open(QIODevice::WriteOnly));
    file.write(content);
}

} // namespace

TEST(WholeSystem, MetadataTravelsToSearchesCasesGetBookmarksAndUnloadIsClean)
{
    QTemporaryDir dir;
    ASSERT_TRUE(dir.isValid());
    const QString previous = QDir::currentPath();
    QDir::setCurrent(dir.path());
    // Two-second passes right up to the present.
    writeFile(dir.filePath(QStringLiteral("routineSyncTimeBuffer.txt")), "2\n");
    writeFile(dir.filePath(QStringLiteral("getObjectDataTimeBuffer.txt")), "0\n");

    SiteRunner site(NovirSite::defaultSite());
    QString error;
    ASSERT_TRUE(site.start(dir.filePath(QStringLiteral("data/Server")), 120, &error)) << qPrintable(error);
    {
        PluginHost host(dir.filePath(QStringLiteral("data")));
        host.setNovirTunnelClient(&site.server());
        ASSERT_TRUE(host.load(QStringLiteral(PLUGIN_MODULE_PATH), &error)) << qPrintable(error);

        // A few short passes fill the store through the whole chain.
        ASSERT_TRUE(waitFor([&]() { return site.server().ingestedObjects() >= 20; }, 30000));

        RequestSenderInfo client;
        int clientId = 0;
        client.senderHandle = &clientId;
        const QVariantMap window{
            {QStringLiteral("startTimestamp"), (QDateTime::currentSecsSinceEpoch() - 600) * 1000},
            {QStringLiteral("endTimestamp"), QDateTime::currentMSecsSinceEpoch()},
            {QStringLiteral("locIDList"), site.recordingLocations()}};
        Recorder search;
        host.request(QStringLiteral("startSearch"), window, client, search.callback());
        ASSERT_TRUE(waitFor([&]() { return search.finals() == 1; }, 10000));
        QList<Reply> replies = search.replies();
        ASSERT_GE(replies.size(), 2);
        QStringList nodes;
        for (const Reply& reply : replies) {
            if (!reply.bFinal) {
                nodes << reply.payload.toMap().value(QStringLiteral("nodeID")).toString();
            }
        }
        // Every hit names its camera from the directory; the multi-channel camera's channels too.
        EXPECT_FALSE(nodes.contains(QString()));
        const QVariantMap hit = replies.first().payload.toMap();

        // A case from that hit, with a bookmark on the recording server.
        Recorder caseReply;
        const QVariantMap item{
            {QStringLiteral("nodeID"), hit.value(QStringLiteral("nodeID"))},
            {QStringLiteral("locID"), hit.value(QStringLiteral("locID"))},
            {QStringLiteral("startTimestamp"), hit.value(QStringLiteral("startTimestamp"))},
            {QStringLiteral("endTimestamp"), hit.value(QStringLiteral("endTimestamp"))},
            {QStringLiteral("caseItemType"), 0},
            {QStringLiteral("objImage"), hit.value(QStringLiteral("objImage"))},
            {QStringLiteral("needBookmark"), true}};
        host.request(QStringLiteral("addCaseWithItem"),
                     QVariantMap{{QStringLiteral("caseName"), QStringLiteral("e2e")},
                                 {QStringLiteral("caseItem"), item}},
                     client, caseReply.callback());
        ASSERT_TRUE(waitFor([&]() { return caseReply.finals() == 1; }, 10000));
        EXPECT_EQ(caseReply.replies().last().strCode, QStringLiteral("0"));
        const QHash<QString, QVariantMap> bookmarks = host.bookmarkPlugin().bookmarks();
        ASSERT_EQ(bookmarks.size(), 1);
        EXPECT_EQ(bookmarks.begin().value().value(QStringLiteral("CameraID")).toString(),
                  hit.value(QStringLiteral("nodeID")).toString());

        // A re-identification search over every location, and the plug-in unloaded under it.
        Recorder reId;
        QVariantMap reIdParams = window;
        reIdParams.insert(QStringLiteral("feature"), hit.value(QStringLiteral("feature")));
        host.request(QStringLiteral("startReIdSearch"), reIdParams, client, reId.callback());
        host.request(QStringLiteral("startSearch"), window, client, search.callback());
        host.unload();
        EXPECT_EQ(host.plugin(), nullptr);
        // Every search that was started got exactly one final reply.
        EXPECT_EQ(reId.finals(), 1);
        EXPECT_EQ(search.finals(), 2);
    }
    QDir::setCurrent(previous);
}
