// The camera directory: merge and rebuild rules, location lookup from other threads, and the
// "InputObjectMetaInfo" text that writeData sends.
#include "CameraInformationCollector.h"
#include "HostFakes.h"
#include "ScriptedTunnelClient.h"

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

class CollectorTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        collector = std::make_unique<CameraInformationCollector>(&tools);
        control = collector->getNOVIRSrvTunnelControl().data();
        auto* c = collector.get();
        QObject::connect(c, &ICameraInformationCollector::cameraInformationChanged, c,
                         [this](const QVariantMap&) { events << u"changed"_s; });
        QObject::connect(c, &ICameraInformationCollector::cameraDisconnected, c,
                         [this](const QString& name) { events << u"disconnected:"_s + name; });
        QObject::connect(c, &ICameraInformationCollector::locationRemoved, c,
                         [this](const QString& name) { events << u"locationRemoved:"_s + name; });
    }

    // Plays the tunnel control's signals, written as "cam A 81 [Location Group]", "cams A,B",
    // "loc A Loc1 [Group]", "locs A=Loc1,B=Loc2", "on A", "off A", "rmcam A", "rmloc A"; steps
    // are separated by ';'.
    void play(const QString& script)
    {
        for (const QString& step : script.split(u';', Qt::SkipEmptyParts)) {
            const QStringList w = step.split(u' ', Qt::SkipEmptyParts);
            if (w[0] == u"cam"_s) {
                QVariantMap record{{u"Name"_s, w[1]}, {u"Port"_s, w[2].toInt()}};
                if (w.size() > 4) {
                    record.insert(u"Location"_s, w[3]);
                    record.insert(u"GroupID"_s, w[4].toInt());
                }
                emit control->updateCamera(w[1], record);
            } else if (w[0] == u"cams"_s) {
                QVariantMap cameras;
                for (const QString& name : w[1].split(u',')) {
                    cameras.insert(name, QVariantMap{{u"Name"_s, name}, {u"Port"_s, 80}});
                }
                emit control->updateCameras(cameras);
            } else if (w[0] == u"loc"_s) {
                emit control->addLocation(w[1], location(w[2], w.value(3, u"1"_s).toInt()));
            } else if (w[0] == u"locs"_s) {
                QVariantMap locations;
                for (const QString& pair : w[1].split(u',')) {
                    locations.insert(pair.section(u'=', 0, 0), location(pair.section(u'=', 1)));
                }
                emit control->updateLocations(locations);
            } else if (w[0] == u"on"_s || w[0] == u"off"_s) {
                emit control->updateCameraStatus(w[1], w[0] == u"on"_s);
            } else if (w[0] == u"rmcam"_s) {
                emit control->removeCamera(w[1]);
            } else if (w[0] == u"rmloc"_s) {
                emit control->removeLocation(w[1]);
            } else {
                ADD_FAILURE() << "unknown step " << qPrintable(step);
            }
        }
    }
    // The directory as "A(Port,Location,GroupID,IsRecording)", '-' for what a record lacks.
    QString directory() const
    {
        QStringList cameras;
        const QVariantMap map = collector->cameraDirectory();
        for (auto it = map.cbegin(); it != map.cend(); ++it) {
            QStringList values;
            for (const char* key : {"Port", "Location", "GroupID", "IsRecording"}) {
                const QVariant value = it->toMap().value(QLatin1String(key));
                values << (value.isValid() ? value.toString() : u"-"_s);
            }
            cameras << it.key() + u'(' + values.join(u',') + u')';
        }
        return cameras.join(u' ');
    }
    const ScriptedTunnelClient::Request* sentMetaInfo() const
    {
        const int index = client.lastRequest(u"InputObjectMetaInfo"_s);
        return index < 0 ? nullptr : &client.requests.at(index);
    }
    QString sentInfo() const
    {
        const QString content = sentMetaInfo() ? sentMetaInfo()->info.strContent : QString();
        const qsizetype start = content.indexOf(u"<Info>"_s) + 6;
        return content.mid(start, content.lastIndexOf(u"</Info>"_s) - start);
    }

    ScriptedTunnelClient client;
    TestTools tools{nullptr, &client};
    std::unique_ptr<CameraInformationCollector> collector;
    NOVIRSrvTunnelControl* control = nullptr;
    QStringList events;
};

} // namespace

TEST_F(CollectorTest, CameraNeedsRecordLocationAndOnlineStatus)
{
    struct Row
    {
        const char* script;
        const char* directory;
        const char* events; // null: not checked
    };
    const std::vector<Row> rows{
        {"cams A; locs A=Loc1", "", "changed changed"},
        {"cams A; locs A=Loc1; on A", "A(80,Loc1,1,true)", nullptr},
        {"cam A 80; loc A Loc1; on A; off A", "", "changed changed changed disconnected:A changed"},
        {"rmcam nobody", "", "changed"},
        // Updates of offline cameras are kept for when they come back.
        {"loc A Loc1; off A; cam A 81", "", nullptr},
        {"loc A Loc1; off A; cam A 81; on A", "A(81,Loc1,1,true)", nullptr},
        // Removing the camera keeps its status and location: its next record announces it at once.
        {"cam A 80; loc A Loc1; on A; rmcam A", "", nullptr},
        {"cam A 80; loc A Loc1; on A; rmcam A; cam A 82", "A(82,Loc1,1,true)", nullptr},
        // A new camera list replaces the old one.
        {"cam A 80; loc A Loc1; on A; cam B 80; loc B Loc2; on B", "A(80,Loc1,1,true) B(80,Loc2,1,true)",
         nullptr},
        {"cam A 80; loc A Loc1; on A; cam B 80; loc B Loc2; on B; cams B", "B(80,Loc2,1,true)", nullptr},
        // A removed location leaves the directory and comes back, not recording, with the next merge;
        // without a location record, removal leaves one holding only the flag.
        {"cam A 80; loc A Loc1; on A; rmloc A", "", "changed changed changed locationRemoved:A changed"},
        {"cam A 80; loc A Loc1; on A; rmloc A; on A", "A(80,Loc1,1,false)", nullptr},
        {"cam B 80; rmloc B; on B", "B(80,-,-,false)", nullptr},
        // Location values win over the camera's own.
        {"cam A 80 LocX 9; loc A Loc4 2; on A", "A(80,Loc4,2,true)", nullptr},
    };
    for (const Row& row : rows) {
        SetUp();
        QVariantMap announced;
        QObject::connect(collector.get(), &ICameraInformationCollector::cameraInformationChanged,
                         collector.get(), [&](const QVariantMap& map) { announced = map; });
        play(QString::fromUtf8(row.script));
        EXPECT_EQ(directory(), QString::fromUtf8(row.directory)) << row.script;
        EXPECT_EQ(announced, collector->cameraDirectory()) << row.script;
        if (row.events) {
            EXPECT_EQ(events.join(u' '), QString::fromUtf8(row.events)) << row.script;
        }
        events.clear();
    }
}

TEST_F(CollectorTest, LocationLookupFollowsEveryChangeAndServesOtherThreads)
{
    EXPECT_TRUE(collector->getCameraNodeID(u"Loc1"_s).isEmpty());
    play(u"locs Zed=Loc1,Alpha=Loc1,Mid=Loc2"_s);
    EXPECT_EQ(collector->getCameraNodeID(u"Loc1"_s), u"Alpha"_s); // first by name
    EXPECT_EQ(collector->getCameraNodeID(u"Loc2"_s), u"Mid"_s);
    EXPECT_TRUE(collector->getCameraNodeID(u"loc2"_s).isEmpty()); // exact match only
    play(u"loc New Loc9"_s);
    EXPECT_EQ(collector->getCameraNodeID(u"Loc9"_s), u"New"_s);
    play(u"locs Mid=Loc1"_s);
    EXPECT_EQ(collector->getCameraNodeID(u"Loc1"_s), u"Mid"_s);
    EXPECT_TRUE(collector->getCameraNodeID(u"Loc9"_s).isEmpty());

    // Request threads look up while the slots change the map.
    play(u"locs A=Loc1,B=Loc2"_s);
    std::atomic<bool> stop{false};
    std::atomic<int> wrong{0};
    std::atomic<int> lookups{0};
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
    ASSERT_NE(sentMetaInfo(), nullptr);
    EXPECT_EQ(sentMetaInfo()->type, NSNovirTunnelClient::ConfigServer);
    EXPECT_EQ(sentMetaInfo()->clientID, &client.account);
    EXPECT_EQ(sentMetaInfo()->info.strContent,
              QStringLiteral("<InputObjectMetaInfo><GroupID>7</GroupID><LocationID>12</LocationID>"
                             "<StartTime>3</StartTime><EndTime>9</EndTime><Info>"
                             R"({"ObjectMetaInfo":[{"ID":5,"LicensePlateThumbnail":[{"image":"p"}],)"
                             R"("ObjectType":"Human"},{"ID":3},{"ID":9}],"Other":1})"
                             "</Info></InputObjectMetaInfo>"));
    // Defaults keep both; an empty settings map drops both.
    collector = std::make_unique<CameraInformationCollector>(&tools);
    collector->writeData(1, 1, body);
    EXPECT_TRUE(sentInfo().contains(u"\"FaceThumbnail"_s) &&
                sentInfo().contains(u"\"LicensePlateThumbnail"_s));
    collector->setDelvixSettings(QVariantMap());
    collector->writeData(1, 1, body);
    EXPECT_FALSE(sentInfo().contains(u"Thumbnail\""_s));

    // Markup is escaped, "%1" is data, non-ASCII text survives, text without markup is the compact
    // JSON byte for byte, characters XML does not allow at all go out as their JSON escapes, and
    // IDs are 64 bits wide. (The fuzz target checks that every text reads back as sent.)
    const QString rows[][2] = {
        {uR"({"ObjectMetaInfo":[{"ID":1,"P":"京A<b>&%1"}]})"_s,
         uR"({"ObjectMetaInfo":[{"ID":1,"P":"京A&lt;b&gt;&amp;%1"}]})"_s},
        {uR"({"ObjectMetaInfo":[{"ID":1,"P":"<x>"}]})"_s,
         uR"({"ObjectMetaInfo":[{"ID":1,"P":"&lt;x&gt;"}]})"_s},
        {uR"({"ObjectMetaInfo":[{"ID":1, "P":"Zoë"}]})"_s, uR"({"ObjectMetaInfo":[{"ID":1,"P":"Zoë"}]})"_s},
        {u"{\"ObjectMetaInfo\":[{\"ID\":1,\"N\":\"a\uFFFFb\uFFFE\"}]}"_s,
         uR"({"ObjectMetaInfo":[{"ID":1,"N":"a\uffffb\ufffe"}]})"_s},
        {uR"({"ObjectMetaInfo":[{"ID":10000000000}]})"_s, uR"({"ObjectMetaInfo":[{"ID":10000000000}]})"_s},
    };
    for (const auto& [body, info] : rows) {
        collector->writeData(-1, -2, body);
        EXPECT_EQ(sentInfo(), info) << qPrintable(body);
    }
    EXPECT_TRUE(sentMetaInfo()->info.strContent.startsWith(
        u"<InputObjectMetaInfo><GroupID>-1</GroupID><LocationID>-2</LocationID><StartTime>10000000000</StartTime>"_s));
}

TEST(CollectorWithHastyClient, AnswersArrivingDuringConstructionAreNotLost)
{
    ScriptedTunnelClient client;
    client.connectOnRegister = true;
    client.onInsert = [&client](int index) {
        const QString cmd = client.requests.at(index).cmdName;
        if (cmd == u"GetNodeInfo"_s) {
            client.answer(
                index, true, u"0"_s,
                u"<NodeInfo><Cameras><Cam><Name>A</Name><ObjectMetaRecordCap>true</ObjectMetaRecordCap>"
                "</Cam></Cameras></NodeInfo>"_s);
        } else if (cmd == u"QryLocs"_s) {
            client.answer(index, true, u"0"_s,
                          u"<LocRecs><LocList><Live>true</Live><Loc><Alias>A</Alias><Name>Loc1</Name>"
                          "<GrpID>1</GrpID></Loc></LocList></LocRecs>"_s);
        } else if (cmd == u"SubCamStatus"_s) {
            client.statusEvent(
                client.serverId, QString(),
                u"<CamStatus><Cam><Name>A</Name><ConnState>Connected</ConnState></Cam></CamStatus>"_s);
        }
    };
    TestTools tools(nullptr, &client);
    CameraInformationCollector collector(&tools);
    EXPECT_EQ(collector.cameraDirectory().keys(), QStringList{u"A"_s});
    EXPECT_EQ(collector.getCameraNodeID(u"Loc1"_s), u"A"_s);

    CameraInformationCollector alone(nullptr); // no tunnel client at all: quiet
    alone.writeData(1, 1, uR"({"ObjectMetaInfo":[{"ID":1}]})"_s);
    EXPECT_TRUE(alone.getCameraNodeID(u"Loc1"_s).isEmpty());
}
