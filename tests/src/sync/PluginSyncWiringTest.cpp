// The plug-in's side of synchronisation: directory signals reach the installed synchroniser,
// fetched metadata with objects reaches the directory's writeData, and "retrieveDelvixData" from a
// host thread runs on the plug-in's thread without a reply.
#include "CameraSynchronizer.h"
#include "DelvixKeys.h"
#include "HostFakes.h"
#include "PluginDelvixSrv.h"
#include "ReplyRecorder.h"

#include <QDir>
#include <QTemporaryDir>
#include <gtest/gtest.h>

#include <thread>

namespace {

QVariantMap record(const QString& name, const QString& location)
{
    return QVariantMap{{"Name", name},     {"IP", "127.0.0.1"}, {"Port", 80},           {"User", "u"},
                       {"Password", "70"}, {"UseSSL", false},   {"Location", location}, {"GroupID", 7}};
}

class PluginSyncWiringTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        previousDir = QDir::currentPath();
        QDir::setCurrent(dir.path()); // no settings files
        auto owned = QSharedPointer<CameraSynchronizer>::create(std::make_shared<CameraProxy>(client));
        sync = owned.data();
        plugin.setCameraSynchronizer(owned);
        plugin.setCameraInformationCollector(QSharedPointer<ICameraInformationCollector>(collector));
        ASSERT_TRUE(plugin.InitialPluginBase(nullptr));
    }
    void TearDown() override { QDir::setCurrent(previousDir); }

    QTemporaryDir dir;
    QString previousDir;
    std::shared_ptr<RecordingHttpClient> client = std::make_shared<RecordingHttpClient>();
    PluginDelvixSrv plugin;
    CameraSynchronizer* sync = nullptr;           // owned by the plug-in
    FakeCollector* collector = new FakeCollector; // owned by the plug-in
};

} // namespace

TEST_F(PluginSyncWiringTest, DirectorySignalsReachTheInstalledSynchronizer)
{
    emit collector->cameraInformationChanged({{"a", record("a", "Loc3")}, {"b", record("b", "Loc4")}});
    sync->synchronize();
    EXPECT_EQ(client->calls.size(), 2);

    sync->updateLastSync({{"a", 100u}, {"b", 200u}, {"c", 300u}});
    emit collector->locationRemoved("a");
    emit collector->cameraDisconnected("b");
    EXPECT_EQ(sync->getLastSyncMap(), (QVariantMap{{"c", 300u}}));

    plugin.setEnableDelvix({{"enable", false}, {"faceEnable", true}});
    sync->synchronize();
    EXPECT_TRUE(sync->getLastSyncMap().isEmpty());
    EXPECT_TRUE(collector->settings().value("faceEnable").toBool());
}

TEST_F(PluginSyncWiringTest, FetchedMetadataWithObjectsIsWrittenToTheDirectory)
{
    emit collector->cameraInformationChanged({{"a", record("a", "Loc12")},
                                              {"b", record("b", "12")},
                                              {"c", record("c", "Locab")},
                                              {"d", record("d", "Loc5")}});
    const QVariantMap some{{"data", QByteArray("{\"ObjectMetaInfo\":[{\"ID\":1}]}")}, {"count", 1}};
    for (const char* camera : {"a", "b", "c"}) {
        sync->receiveObjectMeta(camera, 10, some);
    }
    sync->receiveObjectMeta("d", 10,
                            QVariantMap{{"data", QByteArray("{\"ObjectMetaInfo\":[]}")}, {"count", 0}});
    sync->receiveObjectMeta("d", 11, QVariantMap{{"data", QByteArray("{}")}});
    const QList<FakeCollector::Write> writes = collector->writes();
    ASSERT_EQ(writes.size(), 3);
    EXPECT_EQ(writes[0].group, 7);
    EXPECT_EQ(writes[0].data, "{\"ObjectMetaInfo\":[{\"ID\":1}]}");
    EXPECT_EQ((QList<int>{writes[0].location, writes[1].location, writes[2].location}),
              (QList<int>{12, 12, 0}));
    EXPECT_EQ(sync->getLastSyncMap().value("d").toUInt(), 11u); // still synchronised

    // A window asked for from a host thread goes out on the plug-in's thread, with no reply.
    ReplyRecorder replies;
    std::thread([&] {
        plugin.Request(
            CMD_RETRIEVE_DELVIX_DATA,
            QVariantMap{{KEY_NODE_ID, "a"}, {KEY_START_TIMESTAMP, 1000}, {KEY_END_TIMESTAMP, 5000}},
            RequestSenderInfo(), replies.callback());
    }).join();
    EXPECT_TRUE(client->calls.isEmpty());
    EXPECT_TRUE(waitFor([&] { return !client->calls.isEmpty(); }));
    EXPECT_EQ(client->paths(), QStringList{"/VCA/Data/DB/ObjectMeta?StartTime=1000&EndTime=5000&Info=127"});
    EXPECT_TRUE(replies.replies().empty());
}
