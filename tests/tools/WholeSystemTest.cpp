// The whole system in one process, on real threads and loopback sockets: the built-in site's
// simulated cameras, the configuration server and its store, the host and the loaded plug-in
// module. The metadata of every recording location (the protected camera and both channels of the
// two-channel camera among them) travels the whole road and is stored; a search finds it with its
// camera, a case made from a hit gets its bookmark, and the plug-in unloads cleanly while searches
// run. And the same road while the store has no room: refused ingests are counted, nothing stored
// goes missing, and storing resumes.

#include "Faults.h"
#include "PluginHost.h"
#include "ReplyRecorder.h"
#include "SiteRunner.h"
#include "StoreFixture.h"
#include "TestWait.h"

#include <QDateTime>
#include <QDir>
#include <QDirIterator>
#include <QFile>
#include <QSet>
#include <QTemporaryDir>
#include <algorithm>
#include <gtest/gtest.h>
#include <set>

namespace {

class WholeSystem : public ::testing::Test
{
protected:
    void SetUp() override
    {
        QDir::setCurrent(m_dir.path());
        // The synchroniser reads its settings from the working directory: one-second passes up to now.
        for (const auto& [name, value] :
             {std::pair{"routineSyncTimeBuffer.txt", "1\n"}, {"getObjectDataTimeBuffer.txt", "0\n"}}) {
            QFile file(m_dir.filePath(QLatin1String(name)));
            ASSERT_TRUE(file.open(QIODevice::WriteOnly) && file.write(value) > 0);
        }
        QString error;
        ASSERT_TRUE(m_site.start(storageDir(), 600, &error)) << qPrintable(error);
        QObject::connect(&m_site.server(), &NovirConfigServer::metaInfoIngested, &m_context,
                         [this](int, int location, int objects) {
                             objects > 0 ? void(m_storedLocations.insert(location)) : void();
                         });
        m_host = std::make_unique<PluginHost>(m_dir.filePath("data"));
        m_host->setNovirTunnelClient(&m_site.server());
        ASSERT_TRUE(m_host->load(QStringLiteral(PLUGIN_MODULE_PATH), &error)) << qPrintable(error);
    }

    void TearDown() override
    {
        m_host.reset();
        QDir::setCurrent(m_previous);
    }

    QString storageDir() const { return m_dir.filePath("data/Server"); }

    // Every object the store holds at locations 1..9, as (location, ID); a search that does not
    // end normally fails the test.
    std::set<std::pair<uint32_t, uint64_t>> storedObjects() const
    {
        std::set<std::pair<uint32_t, uint64_t>> objects;
        storetest::QueryOptions everything;
        everything.locations = {1, 2, 3, 4, 5, 6, 7, 8, 9};
        void* database = storetest::openStore(storageDir().toStdString()); // null fails the search
        for (const storetest::ResultCopy& object : storetest::searchStore(database, everything)) {
            objects.insert({object.location, object.id});
        }
        Tamsa_ReleaseDatabase(&database);
        return objects;
    }

    const QString m_previous = QDir::currentPath();
    QTemporaryDir m_dir;
    SiteRunner m_site{NovirSite::defaultSite()};
    QObject m_context;
    QSet<int> m_storedLocations; // locations with objects stored, on the main thread
    std::unique_ptr<PluginHost> m_host;
};

} // namespace

TEST_F(WholeSystem, EveryLocationIsStoredFoundAndBookmarkedAndUnloadIsClean)
{
    // Every camera in the directory that records metadata, has a location and is online: the
    // protected camera and each channel of the two-channel camera have one of their own.
    QSet<int> expected;
    for (const QString& location : m_site.recordingLocations()) {
        expected.insert(QString(location).remove("Loc").toInt());
    }
    ASSERT_GE(expected.size(), 5);
    waitFor([&]() { return m_storedLocations.contains(expected); }, 30000);
    EXPECT_EQ(m_storedLocations, expected);

    RequestSenderInfo client;
    client.senderHandle = &client; // any address tells this client apart
    const QVariantMap window{{"startTimestamp", (QDateTime::currentSecsSinceEpoch() - 600) * 1000},
                             {"endTimestamp", QDateTime::currentMSecsSinceEpoch()},
                             {"locIDList", m_site.recordingLocations()}};
    ReplyRecorder search;
    m_host->request("startSearch", window, client, search.callback());
    ASSERT_TRUE(search.waitFinal());
    const std::vector<QVariant> hits = search.progress();
    ASSERT_FALSE(hits.empty());
    // Every hit names its camera from the directory.
    EXPECT_TRUE(std::none_of(hits.cbegin(), hits.cend(),
                             [](auto& h) { return h.toMap()["nodeID"].toString().isEmpty(); }));

    // A case from a hit, with a bookmark on the recording server.
    const QVariantMap hit = hits.front().toMap();
    QVariantMap item{{"caseItemType", 0}, {"needBookmark", true}};
    for (const char* key : {"nodeID", "locID", "startTimestamp", "endTimestamp", "objImage"}) {
        item.insert(key, hit.value(key));
    }
    ReplyRecorder made;
    m_host->request("addCaseWithItem", QVariantMap{{"caseName", "e2e"}, {"caseItem", item}}, client,
                    made.callback());
    ASSERT_TRUE(made.waitFinal());
    const QHash<QString, QVariantMap> bookmarks = m_host->bookmarkPlugin().bookmarks();
    EXPECT_EQ(QStringList({made.last().code, QString::number(bookmarks.size()),
                           bookmarks.isEmpty() ? "" : bookmarks.begin()->value("CameraID").toString()}),
              QStringList({"0", "1", hit.value("nodeID").toString()}));

    // A re-identification and a search, and the plug-in unloaded under them: each still gets
    // exactly one final reply.
    ReplyRecorder reId, again;
    QVariantMap reIdParams = window;
    reIdParams.insert("feature", hit.value("feature"));
    m_host->request("startReIdSearch", reIdParams, client, reId.callback());
    m_host->request("startSearch", window, client, again.callback());
    m_host->unload();
    EXPECT_EQ(reId.finalCount() * 10 + again.finalCount(), 11);
}

// The file-size limit stays in a second process of this program.
TEST(WholeSystemFaults, StoreWithoutRoomCountsRefusedIngestsAndResumes)
{
    runDisabledTestInChild("WholeSystem.DISABLED_StoreRunsOutOfRoomThenHasRoomAgain", 240000);
}

TEST_F(WholeSystem, DISABLED_StoreRunsOutOfRoomThenHasRoomAgain)
{
    NovirConfigServer& server = m_site.server();
    ASSERT_TRUE(waitFor([&]() { return server.ingestedObjects() > 0; }, 30000));
    std::set<std::pair<uint32_t, uint64_t>> whileFull;
    int storedWhileFull = 0;
    {
        // Full: no file may grow past the largest the store has now; writes fail with EFBIG, the
        // way they fail with ENOSPC on a full disk.
        qint64 largest = 0;
        for (QDirIterator it(storageDir(), QDir::Files, QDirIterator::Subdirectories); it.hasNext();) {
            largest = qMax(largest, it.nextFileInfo().size());
        }
        const FileSizeLimit full(static_cast<unsigned long long>(largest));
        const int failedBefore = server.failedIngests();
        EXPECT_TRUE(waitFor([&]() { return server.failedIngests() >= failedBefore + 3; }, 60000))
            << "the store refused nothing";
        whileFull = storedObjects(); // searches still answer
        EXPECT_FALSE(whileFull.empty());
        storedWhileFull = server.ingestedObjects();
    }
    EXPECT_TRUE(waitFor([&]() { return server.ingestedObjects() > storedWhileFull; }, 30000))
        << "ingest did not resume";
    m_host->unload();
    const std::set<std::pair<uint32_t, uint64_t>> after = storedObjects();
    EXPECT_GT(after.size(), whileFull.size());
    EXPECT_TRUE(std::includes(after.cbegin(), after.cend(), whileFull.cbegin(), whileFull.cend()))
        << "objects stored before the store filled up are gone";
}
