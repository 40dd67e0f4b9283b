// The plug-in's side of synchronisation: directory signals reach the installed synchroniser,
// fetched metadata with objects reaches the directory's writeData, and "retrieveDelvixData"
// from a host thread runs on the plug-in's thread without a reply.
#include "CameraSynchronizer.h"
#include "DelvixKeys.h"
#include "PluginDelvixSrv.h"
#include "RecordingHttpClient.h"

#include <QCoreApplication>
#include <QDir>
#include <QTemporaryDir>
#include <QThread>
#include <gtest/gtest.h>

#include <thread>

namespace {

class RecordingCollector : public ICameraInformationCollector
{
public:
    struct Write
    {
        int group;
        int location;
        QString data;
    };
    void writeData(int groupID, int locationID, const QString& data) override
    {
        writes.append({groupID, locationID, data});
    }
    void setDelvixSettings(const QVariantMap& settings) override { this->settings = settings; }
    QString getCameraNodeID(const QString&) override { return QString(); }

    QList<Write> writes;
    QVariantMap settings;
};

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
        QDir::setCurrent(m_dir.path()); // no settings files
        m_client = std::make_shared<RecordingHttpClient>();
        auto sync = QSharedPointer<CameraSynchronizer>(
            new CameraSynchronizer(std::make_shared<CameraProxy>(m_client)));
        m_sync = sync.data();
        m_collector = new RecordingCollector;
        m_plugin.setCameraSynchronizer(sync);
        m_plugin.setCameraInformationCollector(QSharedPointer<ICameraInformationCollector>(m_collector));
        ASSERT_TRUE(m_plugin.InitialPluginBase(nullptr));
    }

    QTemporaryDir m_dir;
    std::shared_ptr<RecordingHttpClient> m_client;
    PluginDelvixSrv m_plugin;
    CameraSynchronizer* m_sync = nullptr;      // owned by the plug-in
    RecordingCollector* m_collector = nullptr; // owned by the plug-in
};

} // namespace

TEST_F(PluginSyncWiringTest, DirectorySignalsReachTheInstalledSynchronizer)
{
    emit m_collector->cameraInformationChanged({{"a", record("a", "Loc3")}, {"b", record("b", "Loc4")}});
    m_sync->synchronize();
    EXPECT_EQ(m_client->calls.size(), 2);

    m_sync->updateLastSync({{"a", 100u}, {"b", 200u}, {"c", 300u}});
    emit m_collector->locationRemoved("a");
    emit m_collector->cameraDisconnected("b");
    EXPECT_EQ(m_sync->getLastSyncMap(), (QVariantMap{{"c", 300u}}));

    m_plugin.setEnableDelvix({{"enable", false}, {"faceEnable", true}});
    m_sync->synchronize();
    EXPECT_TRUE(m_sync->getLastSyncMap().isEmpty());
    EXPECT_TRUE(m_collector->settings.value("faceEnable").toBool());
}

TEST_F(PluginSyncWiringTest, FetchedMetadataWithObjectsIsWrittenToTheDirectory)
{
    emit m_collector->cameraInformationChanged({{"a", record("a", "Loc12")},
                                                {"b", record("b", "12")},
                                                {"c", record("c", "Locab")},
                                                {"d", record("d", "Loc5")}});
    const QVariantMap some{{"data", QByteArray("{\"ObjectMetaInfo\":[{\"ID\":1}]}")}, {"count", 1}};
    m_sync->receiveObjectMeta("a", 10, some);
    m_sync->receiveObjectMeta("b", 10, some);
    m_sync->receiveObjectMeta("c", 10, some);
    m_sync->receiveObjectMeta("d", 10,
                              QVariantMap{{"data", QByteArray("{\"ObjectMetaInfo\":[]}")}, {"count", 0}});
    m_sync->receiveObjectMeta("d", 11, QVariantMap{{"data", QByteArray("{}")}});
    ASSERT_EQ(m_collector->writes.size(), 3);
    EXPECT_EQ(m_collector->writes[0].group, 7);
    EXPECT_EQ(m_collector->writes[0].location, 12);
    EXPECT_EQ(m_collector->writes[0].data, "{\"ObjectMetaInfo\":[{\"ID\":1}]}");
    EXPECT_EQ(m_collector->writes[1].location, 12);
    EXPECT_EQ(m_collector->writes[2].location, 0);
    EXPECT_EQ(m_sync->getLastSyncMap().value("d").toUInt(), 11u); // still synchronised
}

TEST_F(PluginSyncWiringTest, RetrieveDelvixDataRunsOnThePluginThreadWithoutReply)
{
    emit m_collector->cameraInformationChanged({{"a", record("a", "Loc1")}});
    int replies = 0;
    std::thread host([&] {
        m_plugin.Request(
            CMD_RETRIEVE_DELVIX_DATA,
            QVariantMap{{KEY_NODE_ID, "a"}, {KEY_START_TIMESTAMP, 1000}, {KEY_END_TIMESTAMP, 5000}},
            RequestSenderInfo(),
            [&replies](bool, const QString&, const QString&, const QVariant&) { ++replies; });
    });
    host.join();
    EXPECT_TRUE(m_client->calls.isEmpty());
    QCoreApplication::processEvents();
    ASSERT_EQ(m_client->calls.size(), 1);
    EXPECT_EQ(m_client->calls[0].path, "/VCA/Data/DB/ObjectMeta?StartTime=1000&EndTime=5000&Info=127");
    EXPECT_EQ(replies, 0);
}
