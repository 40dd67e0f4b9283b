// The camera directory end to end: the configuration-server simulator on its own thread, the
// tunnel control and the collector on this thread, and the directory they settle on.
#include "CameraInformationCollector.h"
#include "IFrameworkTools.h"
#include "NovirConfigServer.h"
#include "PluginDelvixSrv.h"

#include <QCoreApplication>
#include <QDeadlineTimer>
#include <QTemporaryDir>
#include <QThread>
#include <functional>
#include <gtest/gtest.h>
#include <memory>

namespace {

class SimulatorTools final : public IFrameworkTools
{
public:
    explicit SimulatorTools(INovirTunnelClient* client)
        : m_client(client)
    {}
    IPluginManager* GetPluginManager() override { return nullptr; }
    INovirTunnelClient* GetNovirTunnelClient() override { return m_client; }
    IRelaySender* GetRelaySender() override { return nullptr; }

private:
    INovirTunnelClient* m_client;
};

NovirCamera makeCamera(const QString& name, int port, const QString& location, bool online = true)
{
    NovirCamera camera;
    camera.name = name;
    camera.port = port;
    camera.user = QStringLiteral("admin");
    camera.password = QStringLiteral("pw-") + name;
    camera.location = location;
    camera.online = online;
    return camera;
}

bool waitFor(const std::function<bool()>& condition)
{
    QDeadlineTimer deadline(10000);
    while (!condition()) {
        if (deadline.hasExpired()) {
            return false;
        }
        QCoreApplication::processEvents(QEventLoop::AllEvents, 5);
        QThread::msleep(1);
    }
    return true;
}

class DirectoryTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        NovirSite site;
        site.serverId = QStringLiteral("cfg-it");
        site.partSize = 2; // five cameras: the all-cameras answer comes in three parts
        site.cameras = {makeCamera(QStringLiteral("A"), 18101, QStringLiteral("Loc1")),
                        makeCamera(QStringLiteral("B"), 18102, QStringLiteral("Loc2")),
                        makeCamera(QStringLiteral("C"), 18103, QStringLiteral("Loc3"), false),
                        makeCamera(QStringLiteral("D"), 18104, QString()),
                        makeCamera(QStringLiteral("E"), 18105, QStringLiteral("Loc5"))};
        site.cameras[4].protectCap = true;
        NovirCamera noRecording = makeCamera(QStringLiteral("F"), 18106, QStringLiteral("Loc6"));
        noRecording.recordCap = false;
        site.cameras.append(noRecording);
        server = std::make_unique<NovirConfigServer>(site);
        QString error;
        ASSERT_TRUE(server->openStore(dir.filePath(QStringLiteral("Server")), &error)) << qPrintable(error);
        tools = std::make_unique<SimulatorTools>(server.get());
        collector = std::make_unique<CameraInformationCollector>(tools.get());
        QObject::connect(collector.get(), &ICameraInformationCollector::cameraInformationChanged,
                         collector.get(), [this](const QVariantMap& map) { directory = map; });
        QObject::connect(collector.get(), &ICameraInformationCollector::locationRemoved, collector.get(),
                         [this](const QString& name) { removedLocations << name; });
        server->start();
    }
    void TearDown() override
    {
        collector.reset(); // the server may still call the handlers it holds
        server.reset();
    }
    bool directoryIs(const QStringList& names)
    {
        return waitFor([&] { return directory.keys() == names; });
    }

    QTemporaryDir dir;
    std::unique_ptr<NovirConfigServer> server;
    std::unique_ptr<SimulatorTools> tools;
    std::unique_ptr<CameraInformationCollector> collector;
    QVariantMap directory;
    QStringList removedLocations;
};

} // namespace

TEST_F(DirectoryTest, DirectoryHoldsOnlineCamerasWithLocationsAndFollowsTheSite)
{
    ASSERT_TRUE(directoryIs({QStringLiteral("A"), QStringLiteral("B"), QStringLiteral("E")}))
        << qPrintable(QStringList(directory.keys()).join(','));
    const QVariantMap e = directory.value(QStringLiteral("E")).toMap();
    EXPECT_EQ(e.value(QStringLiteral("Port")).toInt(), 18105);
    EXPECT_EQ(e.value(QStringLiteral("IP")).toString(), QStringLiteral("127.0.0.1"));
    EXPECT_EQ(QByteArray::fromHex(e.value(QStringLiteral("Password")).toString().toLatin1()),
              QByteArray("pw-E"));
    EXPECT_TRUE(e.value(QStringLiteral("DelvixProtect")).toBool());
    EXPECT_EQ(e.value(QStringLiteral("Location")).toString(), QStringLiteral("Loc5"));
    EXPECT_EQ(e.value(QStringLiteral("GroupID")).toInt(), 1);
    EXPECT_TRUE(e.value(QStringLiteral("IsRecording")).toBool());
    EXPECT_EQ(collector->getCameraNodeID(QStringLiteral("Loc2")), QStringLiteral("B"));
    EXPECT_EQ(collector->getCameraNodeID(QStringLiteral("Loc3")),
              QStringLiteral("C")); // offline, still located

    server->setCameraOnline(QStringLiteral("C"), true);
    ASSERT_TRUE(
        directoryIs({QStringLiteral("A"), QStringLiteral("B"), QStringLiteral("C"), QStringLiteral("E")}));
    server->setCameraOnline(QStringLiteral("A"), false);
    ASSERT_TRUE(directoryIs({QStringLiteral("B"), QStringLiteral("C"), QStringLiteral("E")}));

    NovirCamera changed = makeCamera(QStringLiteral("B"), 18202, QStringLiteral("Loc2"));
    server->changeCamera(changed);
    ASSERT_TRUE(waitFor([&] {
        return directory.value(QStringLiteral("B")).toMap().value(QStringLiteral("Port")).toInt() == 18202;
    }));

    server->addCamera(makeCamera(QStringLiteral("G"), 18107, QStringLiteral("Loc7")));
    ASSERT_TRUE(
        directoryIs({QStringLiteral("B"), QStringLiteral("C"), QStringLiteral("E"), QStringLiteral("G")}));
    EXPECT_EQ(collector->getCameraNodeID(QStringLiteral("Loc7")), QStringLiteral("G"));

    server->removeChannel(QStringLiteral("C"));
    ASSERT_TRUE(directoryIs({QStringLiteral("B"), QStringLiteral("E"), QStringLiteral("G")}));
    EXPECT_EQ(removedLocations, QStringList{QStringLiteral("C")});
    server->addChannel(QStringLiteral("D"), QStringLiteral("Loc4"), 2);
    ASSERT_TRUE(
        directoryIs({QStringLiteral("B"), QStringLiteral("D"), QStringLiteral("E"), QStringLiteral("G")}));
    EXPECT_EQ(directory.value(QStringLiteral("D")).toMap().value(QStringLiteral("GroupID")).toInt(), 2);

    server->removeCamera(QStringLiteral("E"));
    ASSERT_TRUE(directoryIs({QStringLiteral("B"), QStringLiteral("D"), QStringLiteral("G")}));

    // The location server comes back: locations are asked for again and replace the old ones.
    server->setServerConnected(NSNovirTunnelClient::LocationServer, false);
    server->setServerConnected(NSNovirTunnelClient::LocationServer, true);
    ASSERT_TRUE(waitFor([&] { return server->answeredCount(QStringLiteral("QryLocs")) == 2; }));
    ASSERT_TRUE(directoryIs({QStringLiteral("B"), QStringLiteral("D"), QStringLiteral("G")}));
}

TEST_F(DirectoryTest, WriteDataReachesTheStore)
{
    ASSERT_TRUE(directoryIs({QStringLiteral("A"), QStringLiteral("B"), QStringLiteral("E")}));
    const QString body = QString::fromUtf8(
        R"({"ObjectMetaInfo":[{"ID":11,"ObjectType":"Vehicle","StartTime":1700000000,"EndTime":1700000005,)"
        R"("Attributes":{"Type":"Car","Color":[1],"PlateNumber":"京A<1>&2"},"Trajectory":[{"x":0.1,"y":0.1}],)"
        R"("Thumbnail":[{"image":"aGk="}]},)"
        R"({"ID":12,"ObjectType":"Human","StartTime":1700000001,"EndTime":1700000009,)"
        R"("Attributes":{"Age":"30","Gender":1},"Trajectory":[{"x":0.2,"y":0.3}],"Thumbnail":[]}]})");
    collector->writeData(1, 2, body);
    ASSERT_TRUE(waitFor([&] { return server->answeredCount(QStringLiteral("InputObjectMetaInfo")) == 1; }));
    EXPECT_EQ(server->ingestedObjects(), 2);
}

TEST_F(DirectoryTest, PluginCreatesTheCollectorOnTheHostsTunnelClient)
{
    PluginDelvixSrv plugin;
    ASSERT_TRUE(plugin.InitialPluginBase(tools.get()));
    const QStringList expected = {QStringLiteral("A"), QStringLiteral("B"), QStringLiteral("E")};
    ASSERT_TRUE(waitFor([&] { return plugin.cameraDirectory().keys() == expected; }))
        << qPrintable(QStringList(plugin.cameraDirectory().keys()).join(','));

    // A collector installed beforehand stays in place.
    PluginDelvixSrv second;
    auto installed = QSharedPointer<CameraInformationCollector>::create(nullptr);
    second.setCameraInformationCollector(installed);
    ASSERT_TRUE(second.InitialPluginBase(tools.get()));
    EXPECT_EQ(second.cameraDirectory(), QVariantMap());
    EXPECT_EQ(installed->getNOVIRSrvTunnelControl()->getServerAccountID(), nullptr);
}
