// The camera directory: merge and rebuild rules, location lookup from other threads, the
// "InputObjectMetaInfo" text that writeData sends, and end to end with the configuration-server
// simulator on its own thread.
#include "CameraInformationCollector.h"
#include "HostFakes.h"
#include "NovirConfigServer.h"
#include "ScriptedTunnelClient.h"
#include "TestWait.h"

#include <QTemporaryDir>
#include <QThread>
#include <atomic>
#include <gtest/gtest.h>
#include <memory>

using namespace Qt::StringLiterals;

namespace {

QVariantMap location(const QString& loc, int group = 1)
{
    return QVariantMap{{u"Location"_s, loc}, {u"GroupID"_s, group}, {u"IsRecording"_s, true}};
}

// The directory as "A(Port,Location,GroupID,IsRecording)", '-' for what a record lacks.
QString describe(const QVariantMap& directory)
{
    QStringList cameras;
    for (auto it = directory.cbegin(); it != directory.cend(); ++it) {
        QStringList values;
        for (const char* key : {"Port", "Location", "GroupID", "IsRecording"}) {
            const QVariant value = it->toMap().value(QLatin1String(key));
            values << (value.isValid() ? value.toString() : u"-"_s);
        }
        cameras << it.key() + u'(' + values.join(u',') + u')';
    }
    return cameras.join(u' ');
}

class CollectorTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        collector = std::make_unique<CameraInformationCollector>(&tools);
        control = collector->getNOVIRSrvTunnelControl().data();
        auto* c = collector.get();
        using I = ICameraInformationCollector;
        QObject::connect(c, &I::cameraInformationChanged, c, [this](const QVariantMap& map) {
            events << u"changed"_s;
            announced = map;
        });
        QObject::connect(c, &I::cameraDisconnected, c, [this](const QString& n) { events << u"off:"_s + n; });
        QObject::connect(c, &I::locationRemoved, c, [this](const QString& n) { events << u"unloc:"_s + n; });
    }

    // Plays the tunnel control's signals, written as "cam A 81 [Location Group]", "cams A,B",
    // "loc A Loc1 [Group]", "locs A=Loc1,B=Loc2", "on A", "off A", "rmcam A", "rmloc A"; steps
    // are separated by ';'.
    void play(const QString& script)
    {
        for (const QString& step : script.split(u';', Qt::SkipEmptyParts)) {
            const QStringList w = step.split(u' ', Qt::SkipEmptyParts);
            QVariantMap map;
            for (const QString& pair : w[1].split(u',')) {
                map.insert(pair.section(u'=', 0, 0), w[0] == u"cams"_s ? QVariantMap{{u"Port"_s, 80}}
                                                                       : location(pair.section(u'=', 1)));
            }
            if (w[0] == u"cam"_s) {
                QVariantMap record{{u"Name"_s, w[1]}, {u"Port"_s, w[2].toInt()}};
                if (w.size() > 4) {
                    record.insert(location(w[3], w[4].toInt()));
                }
                emit control->updateCamera(w[1], record);
            } else if (w[0] == u"cams"_s) {
                emit control->updateCameras(map);
            } else if (w[0] == u"loc"_s) {
                emit control->addLocation(w[1], location(w[2], w.value(3, u"1"_s).toInt()));
            } else if (w[0] == u"locs"_s) {
                emit control->updateLocations(map);
            } else if (w[0] == u"on"_s || w[0] == u"off"_s) {
                emit control->updateCameraStatus(w[1], w[0] == u"on"_s);
            } else if (w[0] == u"rmcam"_s) {
                emit control->removeCamera(w[1]);
            } else {
                emit control->removeLocation(w[1]);
            }
        }
    }
    QString sent() const
    {
        return client.requests.value(client.lastRequest(u"InputObjectMetaInfo"_s)).info.strContent;
    }
    QString sentInfo() const { return sent().section(u"<Info>"_s, 1).section(u"</Info>"_s, 0, 0); }

    ScriptedTunnelClient client;
    TestTools tools{nullptr, &client};
    std::unique_ptr<CameraInformationCollector> collector;
    NOVIRSrvTunnelControl* control = nullptr;
    QStringList events;
    QVariantMap announced;
};

} // namespace

TEST_F(CollectorTest, CameraNeedsRecordLocationAndOnlineStatus)
{
    const char* rows[][3] = {
        // script, directory, events ("" unchecked)
        {"cams A; locs A=Loc1", "", "changed changed"},
        {"cam A 80; loc A Loc1; on A; off A", "", "changed changed changed off:A changed"},
        // Updates of offline cameras are kept for when they come back.
        {"loc A Loc1; off A; cam A 81; on A", "A(81,Loc1,1,true)", ""},
        // Removing the camera keeps its status and location.
        {"cam A 80; loc A Loc1; on A; rmcam A; cam A 82", "A(82,Loc1,1,true)", ""},
        // A new camera list replaces the old one.
        {"cam A 80; loc A Loc1; on A; cam B 80; loc B Loc2; on B; cams B", "B(80,Loc2,1,true)", ""},
        // A removed location comes back, not recording, with the next merge.
        {"cam A 80; loc A Loc1; on A; rmloc A", "", "changed changed changed unloc:A changed"},
        {"cam A 80; loc A Loc1; on A; rmloc A; on A", "A(80,Loc1,1,false)", ""},
        {"cam B 80; rmloc B; on B", "B(80,-,-,false)", ""},
        // Location values win over the camera's own.
        {"cam A 80 LocX 9; loc A Loc4 2; on A", "A(80,Loc4,2,true)", ""}};
    for (const auto& [script, expected, expectedEvents] : rows) {
        SetUp();
        events.clear();
        play(QString::fromUtf8(script));
        EXPECT_EQ(describe(collector->cameraDirectory()), QString::fromUtf8(expected)) << script;
        EXPECT_EQ(announced, collector->cameraDirectory()) << script;
        EXPECT_TRUE(!*expectedEvents || events.join(u' ') == QString::fromUtf8(expectedEvents)) << script;
    }
}

TEST_F(CollectorTest, LocationLookupFollowsEveryChangeAndServesOtherThreads)
{
    play(u"locs Zed=Loc1,Alpha=Loc1,Mid=Loc2; loc New Loc9"_s);
    QStringList found;
    for (const char* loc : {"Loc1", "Loc2", "loc2", "Loc9"}) {
        found << collector->getCameraNodeID(QString::fromUtf8(loc)); // first by name, exact match
    }
    play(u"locs Mid=Loc1"_s);
    found << collector->getCameraNodeID(u"Loc1"_s) << collector->getCameraNodeID(u"Loc9"_s);
    EXPECT_EQ(found.join(u','), u"Alpha,Mid,,New,Mid,"_s);

    // Request threads look up while the slots change the map.
    play(u"locs A=Loc1,B=Loc2"_s);
    std::atomic<bool> stop{false};
    std::atomic<int> wrong{0}, lookups{0};
    std::vector<std::unique_ptr<QThread>> readers;
    for (int i = 0; i < 3; ++i) {
        readers.emplace_back(QThread::create([&]() {
            while (!stop) {
                const QString one = collector->getCameraNodeID(u"Loc1"_s);
                const QString two = collector->getCameraNodeID(u"Loc2"_s);
                wrong += (one != u"A"_s && one != u"C"_s) || (two != u"B"_s && !two.isEmpty()) ? 1 : 0;
                ++lookups;
            }
        }));
        readers.back()->start();
    }
    // Changes go on until the readers have looked up often enough, however late they started.
    for (int round = 0; round < 2000 || lookups < 2000; ++round) {
        play(round % 2 ? u"locs A=Loc1,B=Loc2; loc D Loc3; rmloc D"_s
                       : u"locs C=Loc1; loc D Loc3; rmloc D"_s);
    }
    stop = true;
    for (auto& reader : readers) {
        reader->wait();
    }
    EXPECT_EQ(wrong.load(), 0);
}

TEST_F(CollectorTest, WriteDataSendsTheObjectsWithIdRangeFilteredThumbnailsAndSafeText)
{
    collector->setDelvixSettings(QVariantMap{{u"faceEnable"_s, false}, {u"LPREnable"_s, true}});
    const QString body = QStringLiteral(
        R"({"ObjectMetaInfo":[{"ID":5,"ObjectType":"Human","FaceThumbnail":[{"image":"f"}],)"
        R"("LicensePlateThumbnail":[{"image":"p"}]},{"ID":3,"FaceThumbnail":[]},{"ID":9}],"Other":1})");
    collector->writeData(7, 12, body);
    const auto& request = client.requests.last();
    EXPECT_TRUE(request.type == NSNovirTunnelClient::ConfigServer && request.clientID == &client.account);
    EXPECT_EQ(sent(), QStringLiteral("<InputObjectMetaInfo><GroupID>7</GroupID><LocationID>12</LocationID>"
                                     "<StartTime>3</StartTime><EndTime>9</EndTime><Info>"
                                     R"({"ObjectMetaInfo":[{"ID":5,"LicensePlateThumbnail":[{"image":"p"}],)"
                                     R"("ObjectType":"Human"},{"ID":3},{"ID":9}],"Other":1})"
                                     "</Info></InputObjectMetaInfo>"));
    // Defaults keep both; an empty settings map drops both.
    collector = std::make_unique<CameraInformationCollector>(&tools);
    collector->writeData(1, 1, body);
    EXPECT_EQ(sentInfo().count(u"Thumbnail\""_s), 3);
    collector->setDelvixSettings(QVariantMap());
    collector->writeData(1, 1, body);
    EXPECT_EQ(sentInfo().count(u"Thumbnail\""_s), 0);

    // Markup is escaped, "%1" is data, non-ASCII text survives, characters XML does not allow go out
    // as their JSON escapes, and IDs are 64 bits wide.
    const QString rows[][2] = {
        {uR"({"ObjectMetaInfo":[{"ID":1, "P":"京A<b>&%1"}]})"_s,
         uR"({"ObjectMetaInfo":[{"ID":1,"P":"京A&lt;b&gt;&amp;%1"}]})"_s},
        {uR"({"ObjectMetaInfo":[{"ID":1,"P":"<x>"}]})"_s,
         uR"({"ObjectMetaInfo":[{"ID":1,"P":"&lt;x&gt;"}]})"_s},
        {u"{\"ObjectMetaInfo\":[{\"ID\":1,\"N\":\"a\uFFFFb\uFFFE\"}]}"_s,
         uR"({"ObjectMetaInfo":[{"ID":1,"N":"a\uffffb\ufffe"}]})"_s},
        {uR"({"ObjectMetaInfo":[{"ID":10000000000}]})"_s, uR"({"ObjectMetaInfo":[{"ID":10000000000}]})"_s},
    };
    for (const auto& [body, info] : rows) {
        collector->writeData(-1, -2, body);
        EXPECT_EQ(sentInfo(), info) << qPrintable(body);
    }
    EXPECT_TRUE(sent().startsWith(
        u"<InputObjectMetaInfo><GroupID>-1</GroupID><LocationID>-2</LocationID><StartTime>10000000000</StartTime>"_s));
}

TEST(CollectorWithHastyClient, AnswersArrivingDuringConstructionAreNotLost)
{
    ScriptedTunnelClient client;
    client.connectOnRegister = true;
    client.onInsert = [&client](int index) {
        const QString cmd = client.requests.at(index).cmdName;
        if (cmd == u"SubCamStatus"_s) {
            client.statusEvent(
                client.serverId, QString(),
                u"<CamStatus><Cam><Name>A</Name><ConnState>Connected</ConnState></Cam></CamStatus>"_s);
        } else {
            client.answer(index, true, u"0"_s,
                          cmd == u"QryLocs"_s ? locRecs(u"A"_s, u"Loc1"_s) : nodeInfo({u"A"_s}));
        }
    };
    TestTools tools(nullptr, &client);
    CameraInformationCollector collector(&tools);
    EXPECT_EQ(collector.cameraDirectory().keys(), QStringList{u"A"_s});
    EXPECT_EQ(collector.getCameraNodeID(u"Loc1"_s), u"A"_s);
}

TEST(DirectoryTest, DirectoryHoldsOnlineCamerasWithLocationsAndFollowsTheSite)
{
    auto camera = [](const QString& name, int port, const QString& location, bool online = true) {
        NovirCamera camera;
        camera.name = name;
        camera.port = port;
        camera.user = u"admin"_s;
        camera.password = u"pw-"_s + name;
        camera.location = location;
        camera.online = online;
        return camera;
    };
    NovirSite site;
    site.serverId = u"cfg-it"_s;
    site.partSize = 2; // the all-cameras answer comes in three parts
    site.cameras = {camera(u"A"_s, 18101, u"Loc1"_s),        camera(u"B"_s, 18102, u"Loc2"_s),
                    camera(u"C"_s, 18103, u"Loc3"_s, false), camera(u"D"_s, 18104, QString()),
                    camera(u"E"_s, 18105, u"Loc5"_s),        camera(u"F"_s, 18106, u"Loc6"_s)};
    site.cameras[4].protectCap = true;
    site.cameras[5].recordCap = false;
    QTemporaryDir dir;
    NovirConfigServer server(site);
    QString error;
    ASSERT_TRUE(server.openStore(dir.filePath(u"Server"_s), &error)) << qPrintable(error);
    server.start();
    TestTools tools(nullptr, &server);
    CameraInformationCollector collector(&tools); // goes first: the server may still call its handlers
    QStringList removedLocations;
    QObject::connect(&collector, &ICameraInformationCollector::locationRemoved, &collector,
                     [&](const QString& name) { removedLocations << name; });
    // Waits for the directory to be "A(Port,Location,GroupID,IsRecording) ...".
    auto directoryIs = [&](const QString& expected) {
        const bool settled = waitFor([&] { return describe(collector.cameraDirectory()) == expected; });
        EXPECT_EQ(describe(collector.cameraDirectory()), expected);
        return settled;
    };
    ASSERT_TRUE(directoryIs(u"A(18101,Loc1,1,true) B(18102,Loc2,1,true) E(18105,Loc5,1,true)"_s));
    // The password stays hexadecimal ("pw-E").
    EXPECT_EQ(
        jsonText(collector.cameraDirectory().value(u"E"_s).toMap()),
        uR"({"DelvixProtect":true,"GroupID":"1","IP":"127.0.0.1","IsRecording":"true","Location":"Loc5",)"
        uR"("Name":"E","Password":"70772d45","Port":18105,"UseSSL":false,"User":"admin"})"_s);
    EXPECT_EQ(collector.getCameraNodeID(u"Loc3"_s), u"C"_s); // offline, still located

    // What gets written reaches the server's store.
    collector.writeData(1, 2,
                        uR"({"ObjectMetaInfo":[{"ID":11,"ObjectType":"Vehicle","StartTime":1700000000,)"
                        uR"("EndTime":1700000005,"Attributes":{"Type":"Car","PlateNumber":"京A<1>&2"},)"
                        uR"("Trajectory":[{"x":0.1,"y":0.1}],"Thumbnail":[{"image":"aGk="}]},)"
                        uR"({"ID":12,"ObjectType":"Human","StartTime":1700000001,)"
                        uR"("EndTime":1700000009,"Attributes":{"Age":"30"},"Trajectory":[]}]})"_s);
    EXPECT_TRUE(waitFor([&] { return server.answeredCount("InputObjectMetaInfo") == 1; }));
    EXPECT_EQ(server.ingestedObjects(), 2);

    server.setCameraOnline(u"C"_s, true);
    server.setCameraOnline(u"A"_s, false);
    server.changeCamera(camera(u"B"_s, 18202, u"Loc2"_s));
    server.addCamera(camera(u"G"_s, 18107, u"Loc7"_s));
    ASSERT_TRUE(directoryIs(
        u"B(18202,Loc2,1,true) C(18103,Loc3,1,true) E(18105,Loc5,1,true) G(18107,Loc7,1,true)"_s));
    EXPECT_EQ(collector.getCameraNodeID(u"Loc7"_s), u"G"_s);
    server.removeChannel(u"C"_s);
    server.addChannel(u"D"_s, u"Loc4"_s, 2);
    server.removeCamera(u"E"_s);
    ASSERT_TRUE(directoryIs(u"B(18202,Loc2,1,true) D(18104,Loc4,2,true) G(18107,Loc7,1,true)"_s));
    EXPECT_EQ(removedLocations, QStringList{u"C"_s});

    // The location server comes back: locations are asked for again and replace the old ones.
    server.setServerConnected(NSNovirTunnelClient::LocationServer, false);
    server.setServerConnected(NSNovirTunnelClient::LocationServer, true);
    ASSERT_TRUE(waitFor([&] { return server.answeredCount("QryLocs") == 2; }));
    EXPECT_TRUE(directoryIs(u"B(18202,Loc2,1,true) D(18104,Loc4,2,true) G(18107,Loc7,1,true)"_s));
}
