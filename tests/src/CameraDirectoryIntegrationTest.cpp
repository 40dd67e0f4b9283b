// The camera directory end to end: the configuration-server simulator on its own thread, the
// tunnel control and the collector on this thread, and the directory they settle on.
#include "CameraInformationCollector.h"
#include "HostFakes.h"
#include "NovirConfigServer.h"
#include "TestWait.h"

#include <QJsonDocument>
#include <QJsonObject>
#include <QTemporaryDir>
#include <gtest/gtest.h>
#include <memory>

namespace {

NovirCamera makeCamera(const QString& name, int port, const QString& location, bool online = true)
{
    NovirCamera camera;
    camera.name = name;
    camera.port = port;
    camera.user = "admin";
    camera.password = "pw-" + name;
    camera.location = location;
    camera.online = online;
    return camera;
}

} // namespace

TEST(DirectoryTest, DirectoryHoldsOnlineCamerasWithLocationsAndFollowsTheSite)
{
    NovirSite site;
    site.serverId = "cfg-it";
    site.partSize = 2; // the all-cameras answer comes in three parts
    site.cameras = {makeCamera("A", 18101, "Loc1"),        makeCamera("B", 18102, "Loc2"),
                    makeCamera("C", 18103, "Loc3", false), makeCamera("D", 18104, QString()),
                    makeCamera("E", 18105, "Loc5"),        makeCamera("F", 18106, "Loc6")};
    site.cameras[4].protectCap = true;
    site.cameras[5].recordCap = false;
    QTemporaryDir dir;
    NovirConfigServer server(site);
    QString error;
    ASSERT_TRUE(server.openStore(dir.filePath("Server"), &error)) << qPrintable(error);
    server.start();
    TestTools tools(nullptr, &server);
    CameraInformationCollector collector(&tools); // goes first: the server may still call its handlers
    auto directoryIs = [&](const char* names) {
        const QStringList expected = QString::fromLatin1(names).split(' ', Qt::SkipEmptyParts);
        const bool settled = waitFor([&] { return collector.cameraDirectory().keys() == expected; });
        EXPECT_TRUE(settled) << names << " != " << qPrintable(collector.cameraDirectory().keys().join(' '));
        return settled;
    };
    QStringList removedLocations;
    QObject::connect(&collector, &ICameraInformationCollector::locationRemoved, &collector,
                     [&](const QString& name) { removedLocations << name; });
    ASSERT_TRUE(directoryIs("A B E"));
    // The password stays hexadecimal ("pw-E").
    EXPECT_EQ(
        QJsonDocument(QJsonObject::fromVariantMap(collector.cameraDirectory().value("E").toMap()))
            .toJson(QJsonDocument::Compact),
        R"({"DelvixProtect":true,"GroupID":"1","IP":"127.0.0.1","IsRecording":"true","Location":"Loc5",)"
        R"("Name":"E","Password":"70772d45","Port":18105,"UseSSL":false,"User":"admin"})");
    EXPECT_EQ(collector.getCameraNodeID("Loc3"), "C"); // offline, still located

    // What gets written reaches the server's store.
    collector.writeData(
        1, 2,
        QString::fromUtf8(R"({"ObjectMetaInfo":[{"ID":11,"ObjectType":"Vehicle","StartTime":1700000000,)"
                          R"("EndTime":1700000005,"Attributes":{"Type":"Car","PlateNumber":"京A<1>&2"},)"
                          R"("Trajectory":[{"x":0.1,"y":0.1}],"Thumbnail":[{"image":"aGk="}]},)"
                          R"({"ID":12,"ObjectType":"Human","StartTime":1700000001,)"
                          R"("EndTime":1700000009,"Attributes":{"Age":"30"},"Trajectory":[]}]})"));
    EXPECT_TRUE(waitFor([&] { return server.answeredCount("InputObjectMetaInfo") == 1; }));
    EXPECT_EQ(server.ingestedObjects(), 2);

    server.setCameraOnline("C", true);
    ASSERT_TRUE(directoryIs("A B C E"));
    server.setCameraOnline("A", false);
    ASSERT_TRUE(directoryIs("B C E"));
    server.changeCamera(makeCamera("B", 18202, "Loc2"));
    EXPECT_TRUE(
        waitFor([&] { return collector.cameraDirectory().value("B").toMap().value("Port") == 18202; }));
    server.addCamera(makeCamera("G", 18107, "Loc7"));
    ASSERT_TRUE(directoryIs("B C E G"));
    EXPECT_EQ(collector.getCameraNodeID("Loc7"), "G");
    server.removeChannel("C");
    ASSERT_TRUE(directoryIs("B E G"));
    EXPECT_EQ(removedLocations, QStringList{"C"});
    server.addChannel("D", "Loc4", 2);
    ASSERT_TRUE(directoryIs("B D E G"));
    EXPECT_EQ(collector.cameraDirectory().value("D").toMap().value("GroupID").toInt(), 2);
    server.removeCamera("E");
    ASSERT_TRUE(directoryIs("B D G"));

    // The location server comes back: locations are asked for again and replace the old ones.
    server.setServerConnected(NSNovirTunnelClient::LocationServer, false);
    server.setServerConnected(NSNovirTunnelClient::LocationServer, true);
    ASSERT_TRUE(waitFor([&] { return server.answeredCount("QryLocs") == 2; }));
    EXPECT_TRUE(directoryIs("B D G"));
}
