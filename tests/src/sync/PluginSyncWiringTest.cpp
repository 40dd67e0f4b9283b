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

TEST(PluginSyncWiring, DirectoryAndFetchedMetadataReachTheInstalledSynchronizerAndCollector)
{
    QTemporaryDir dir;
    const QString previousDir = QDir::currentPath();
    QDir::setCurrent(dir.path()); // no settings files
    auto client = std::make_shared<RecordingHttpClient>();
    PluginDelvixSrv plugin;
    auto owned = QSharedPointer<CameraSynchronizer>::create(std::make_shared<CameraProxy>(client));
    CameraSynchronizer* sync = owned.data();
    auto* collector = new FakeCollector; // owned by the plug-in
    plugin.setCameraSynchronizer(owned);
    plugin.setCameraInformationCollector(QSharedPointer<ICameraInformationCollector>(collector));
    ASSERT_TRUE(plugin.InitialPluginBase(nullptr));

    QVariantMap cameras;
    for (const char* location : {"Loc12", "12", "Locab", "Loc5"}) {
        const QString name = QChar(char16_t(u'a' + cameras.size()));
        cameras.insert(name, QVariantMap{{"Name", name},
                                         {"IP", "127.0.0.1"},
                                         {"Port", 80},
                                         {"User", "u"},
                                         {"Password", "70"},
                                         {"UseSSL", false},
                                         {"Location", location},
                                         {"GroupID", 7}});
    }
    emit collector->cameraInformationChanged(cameras);

    // Metadata with objects of a known camera is written with the group and the location number; none, not
    // written.
    const QVariantMap some{{"data", QByteArray("{\"ObjectMetaInfo\":[{\"ID\":1}]}")}, {"count", 1}};
    for (const char* camera : {"a", "b", "c"}) {
        sync->receiveObjectMeta(camera, 10, some);
    }
    sync->receiveObjectMeta("d", 10,
                            QVariantMap{{"data", QByteArray("{\"ObjectMetaInfo\":[]}")}, {"count", 0}});
    sync->receiveObjectMeta("d", 11, QVariantMap{{"data", QByteArray("{}")}});
    QStringList writes;
    for (const FakeCollector::Write& write : collector->writes()) {
        writes << QStringLiteral("%1/%2 %3").arg(write.group).arg(write.location).arg(write.data);
    }
    const QString written = "7/%1 {\"ObjectMetaInfo\":[{\"ID\":1}]}";
    EXPECT_EQ(writes, (QStringList{written.arg(12), written.arg(12), written.arg(0)}));
    EXPECT_EQ(sync->getLastSyncMap().value("d").toUInt(), 11u); // still synchronised

    // Cameras that lose their location or go offline are forgotten.
    emit collector->locationRemoved("a");
    emit collector->cameraDisconnected("b");
    EXPECT_EQ(sync->getLastSyncMap().keys(), (QStringList{"c", "d"}));
    plugin.setEnableDelvix({{"enable", false}, {"faceEnable", true}});
    sync->synchronize();
    EXPECT_TRUE(sync->getLastSyncMap().isEmpty());
    EXPECT_TRUE(collector->settings().value("faceEnable").toBool());
    plugin.setEnableDelvix({{"enable", true}});

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
    QDir::setCurrent(previousDir);
}
