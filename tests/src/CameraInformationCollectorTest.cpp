// The camera directory: merge and rebuild rules, location lookup from other threads, and the
// "InputObjectMetaInfo" text that writeData sends.
#include "CameraInformationCollector.h"
#include "IFrameworkTools.h"
#include "NOVIRImplementation/ScriptedTunnelClient.h"
#include "Quellon.h"

#include <QJsonDocument>
#include <QSignalSpy>
#include <QThread>
#include <atomic>
#include <gtest/gtest.h>
#include <memory>
#include <vector>

namespace {

class FakeTools final : public IFrameworkTools
{
public:
    explicit FakeTools(INovirTunnelClient* client)
        : m_client(client)
    {}
    IPluginManager* GetPluginManager() override { return nullptr; }
    INovirTunnelClient* GetNovirTunnelClient() override { return m_client; }
    IRelaySender* GetRelaySender() override { return nullptr; }

private:
    INovirTunnelClient* m_client;
};

QVariantMap camera(const QString& name, int port = 80)
{
    return QVariantMap{{QStringLiteral("Name"), name},
                       {QStringLiteral("IP"), QStringLiteral("127.0.0.1")},
                       {QStringLiteral("Port"), port},
                       {QStringLiteral("UseSSL"), false},
                       {QStringLiteral("User"), QStringLiteral("u")},
                       {QStringLiteral("Password"), QStringLiteral("70")},
                       {QStringLiteral("DelvixProtect"), false}};
}

QVariantMap location(const QString& loc, int group = 1, bool recording = true)
{
    return QVariantMap{{QStringLiteral("Location"), loc},
                       {QStringLiteral("GroupID"), group},
                       {QStringLiteral("IsRecording"), recording}};
}

class CollectorTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        collector = std::make_unique<CameraInformationCollector>(&tools);
        control = collector->getNOVIRSrvTunnelControl().data();
        // One log of everything announced, in order.
        QObject::connect(collector.get(), &ICameraInformationCollector::cameraInformationChanged,
                         collector.get(), [this](const QVariantMap& map) {
                             events << QStringLiteral("changed");
                             directory = map;
                         });
        QObject::connect(collector.get(), &ICameraInformationCollector::cameraDisconnected, collector.get(),
                         [this](const QString& name) { events << QStringLiteral("disconnected:") + name; });
        QObject::connect(
            collector.get(), &ICameraInformationCollector::locationRemoved, collector.get(),
            [this](const QString& name) { events << QStringLiteral("locationRemoved:") + name; });
    }

    // A camera with its record, location and status true.
    void bringOnline(const QString& name, const QString& loc)
    {
        emit control->updateCamera(name, camera(name));
        emit control->addLocation(name, location(loc));
        emit control->updateCameraStatus(name, true);
    }
    // The request writeData sent, or null.
    const ScriptedTunnelClient::Request* sentMetaInfo() const
    {
        const int index = client.lastRequest(QStringLiteral("InputObjectMetaInfo"));
        return index < 0 ? nullptr : &client.requests.at(index);
    }
    QString infoOf(const QString& content) const
    {
        const qsizetype start = content.indexOf(QStringLiteral("<Info>")) + 6;
        return content.mid(start, content.lastIndexOf(QStringLiteral("</Info>")) - start);
    }

    ScriptedTunnelClient client;
    FakeTools tools{&client};
    std::unique_ptr<CameraInformationCollector> collector;
    NOVIRSrvTunnelControl* control = nullptr;
    QStringList events;
    QVariantMap directory;
};

} // namespace

TEST_F(CollectorTest, CameraIsAnnouncedOnlyWithRecordLocationAndOnlineStatus)
{
    emit control->updateCameras(QVariantMap{{QStringLiteral("A"), camera(QStringLiteral("A"))}});
    emit control->updateLocations(QVariantMap{{QStringLiteral("A"), location(QStringLiteral("Loc1"))}});
    EXPECT_TRUE(directory.isEmpty()); // no status event yet
    EXPECT_EQ(events, (QStringList{QStringLiteral("changed"), QStringLiteral("changed")}));

    emit control->updateCameraStatus(QStringLiteral("A"), true);
    ASSERT_EQ(directory.keys(), QStringList{QStringLiteral("A")});
    const QVariantMap record = directory.value(QStringLiteral("A")).toMap();
    EXPECT_EQ(record.value(QStringLiteral("Port")).toInt(), 80);
    EXPECT_EQ(record.value(QStringLiteral("Location")).toString(), QStringLiteral("Loc1"));
    EXPECT_EQ(record.value(QStringLiteral("GroupID")).toInt(), 1);
    EXPECT_EQ(collector->cameraDirectory(), directory);

    events.clear();
    emit control->updateCameraStatus(QStringLiteral("A"), false);
    EXPECT_EQ(events, (QStringList{QStringLiteral("disconnected:A"), QStringLiteral("changed")}));
    EXPECT_TRUE(directory.isEmpty());

    // Unknown names change nothing but are still announced.
    events.clear();
    emit control->removeCamera(QStringLiteral("nobody"));
    EXPECT_EQ(events, QStringList{QStringLiteral("changed")});
}

TEST_F(CollectorTest, UpdatesOfOfflineOrRemovedCameras)
{
    emit control->addLocation(QStringLiteral("A"), location(QStringLiteral("Loc1")));
    emit control->updateCameraStatus(QStringLiteral("A"), false);
    emit control->updateCamera(QStringLiteral("A"), camera(QStringLiteral("A"), 81));
    EXPECT_TRUE(directory.isEmpty()); // stored, not announced
    emit control->updateCameraStatus(QStringLiteral("A"), true);
    EXPECT_EQ(directory.value(QStringLiteral("A")).toMap().value(QStringLiteral("Port")).toInt(), 81);

    // Removing the camera keeps its status and location: the next record announces it at once.
    emit control->removeCamera(QStringLiteral("A"));
    EXPECT_TRUE(directory.isEmpty());
    emit control->updateCamera(QStringLiteral("A"), camera(QStringLiteral("A"), 82));
    EXPECT_EQ(directory.value(QStringLiteral("A")).toMap().value(QStringLiteral("Port")).toInt(), 82);

    // A new camera list replaces the old one and rebuilds the directory.
    bringOnline(QStringLiteral("B"), QStringLiteral("Loc2"));
    EXPECT_EQ(directory.keys(), (QStringList{QStringLiteral("A"), QStringLiteral("B")}));
    emit control->updateCameras(QVariantMap{{QStringLiteral("B"), camera(QStringLiteral("B"))}});
    EXPECT_EQ(directory.keys(), QStringList{QStringLiteral("B")});
}

TEST_F(CollectorTest, RemovedLocationStaysWithRecordingOff)
{
    bringOnline(QStringLiteral("A"), QStringLiteral("Loc1"));
    events.clear();
    emit control->removeLocation(QStringLiteral("A"));
    EXPECT_EQ(events, (QStringList{QStringLiteral("locationRemoved:A"), QStringLiteral("changed")}));
    EXPECT_TRUE(directory.isEmpty());
    // A later merge brings it back, not recording.
    emit control->updateCameraStatus(QStringLiteral("A"), true);
    const QVariantMap back = directory.value(QStringLiteral("A")).toMap();
    EXPECT_EQ(back.value(QStringLiteral("Location")).toString(), QStringLiteral("Loc1"));
    EXPECT_EQ(back.value(QStringLiteral("IsRecording")), QVariant(false));

    // Without a location record, removal creates one that holds only the recording flag.
    emit control->updateCamera(QStringLiteral("B"), camera(QStringLiteral("B")));
    emit control->removeLocation(QStringLiteral("B"));
    emit control->updateCameraStatus(QStringLiteral("B"), true);
    const QVariantMap b = directory.value(QStringLiteral("B")).toMap();
    EXPECT_EQ(b.value(QStringLiteral("IsRecording")), QVariant(false));
    EXPECT_FALSE(b.contains(QStringLiteral("Location")));
}

TEST_F(CollectorTest, LocationValueWinsOverCameraValue)
{
    QVariantMap record = camera(QStringLiteral("A"));
    record.insert(QStringLiteral("GroupID"), 9);
    record.insert(QStringLiteral("Location"), QStringLiteral("LocX"));
    emit control->updateCamera(QStringLiteral("A"), record);
    emit control->addLocation(QStringLiteral("A"), location(QStringLiteral("Loc4"), 2));
    emit control->updateCameraStatus(QStringLiteral("A"), true);
    const QVariantMap merged = directory.value(QStringLiteral("A")).toMap();
    EXPECT_EQ(merged.value(QStringLiteral("GroupID")).toInt(), 2);
    EXPECT_EQ(merged.value(QStringLiteral("Location")).toString(), QStringLiteral("Loc4"));
    EXPECT_EQ(merged.value(QStringLiteral("Name")).toString(), QStringLiteral("A"));
}

TEST_F(CollectorTest, LocationToCameraFollowsEveryLocationChange)
{
    EXPECT_TRUE(collector->getCameraNodeID(QStringLiteral("Loc1")).isEmpty());
    emit control->updateLocations(QVariantMap{{QStringLiteral("Zed"), location(QStringLiteral("Loc1"))},
                                              {QStringLiteral("Alpha"), location(QStringLiteral("Loc1"))},
                                              {QStringLiteral("Mid"), location(QStringLiteral("Loc2"))}});
    EXPECT_EQ(collector->getCameraNodeID(QStringLiteral("Loc1")), QStringLiteral("Alpha")); // first by name
    EXPECT_EQ(collector->getCameraNodeID(QStringLiteral("Loc2")), QStringLiteral("Mid"));
    EXPECT_TRUE(collector->getCameraNodeID(QStringLiteral("Loc9")).isEmpty());
    EXPECT_TRUE(collector->getCameraNodeID(QStringLiteral("loc2")).isEmpty()); // exact match only
    emit control->addLocation(QStringLiteral("New"), location(QStringLiteral("Loc9")));
    EXPECT_EQ(collector->getCameraNodeID(QStringLiteral("Loc9")), QStringLiteral("New"));
    emit control->updateLocations(QVariantMap{{QStringLiteral("Mid"), location(QStringLiteral("Loc1"))}});
    EXPECT_EQ(collector->getCameraNodeID(QStringLiteral("Loc1")), QStringLiteral("Mid"));
    EXPECT_TRUE(collector->getCameraNodeID(QStringLiteral("Loc9")).isEmpty());
}

TEST_F(CollectorTest, LocationLookupFromRequestThreadsWhileSlotsChangeTheMap)
{
    const QVariantMap first{{QStringLiteral("A"), location(QStringLiteral("Loc1"))},
                            {QStringLiteral("B"), location(QStringLiteral("Loc2"))}};
    const QVariantMap second{{QStringLiteral("C"), location(QStringLiteral("Loc1"))}};
    emit control->updateLocations(first);
    std::atomic<bool> stop{false};
    std::atomic<int> wrong{0};
    std::atomic<long> lookups{0};
    std::vector<std::unique_ptr<QThread>> readers;
    for (int i = 0; i < 3; ++i) {
        readers.emplace_back(QThread::create([&]() {
            while (!stop) {
                const QString one = collector->getCameraNodeID(QStringLiteral("Loc1"));
                const QString two = collector->getCameraNodeID(QStringLiteral("Loc2"));
                if ((one != QStringLiteral("A") && one != QStringLiteral("C")) ||
                    (two != QStringLiteral("B") && !two.isEmpty())) {
                    ++wrong;
                }
                lookups += 2;
            }
        }));
        readers.back()->start();
    }
    for (int round = 0; round < 2000; ++round) {
        emit control->updateLocations(round % 2 ? first : second);
        emit control->addLocation(QStringLiteral("D"), location(QStringLiteral("Loc3")));
        emit control->removeLocation(QStringLiteral("D"));
    }
    stop = true;
    for (auto& reader : readers) {
        reader->wait();
    }
    EXPECT_EQ(wrong.load(), 0);
    EXPECT_GT(lookups.load(), 0);
}

TEST_F(CollectorTest, WriteDataSendsTheObjectsWithIdRangeAndFilteredThumbnails)
{
    collector->setDelvixSettings(
        QVariantMap{{QStringLiteral("faceEnable"), false}, {QStringLiteral("LPREnable"), true}});
    const QString body = QStringLiteral(
        R"({"ObjectMetaInfo":[{"ID":5,"ObjectType":"Human","FaceThumbnail":[{"image":"f"}],)"
        R"("LicensePlateThumbnail":[{"image":"p"}]},{"ID":3,"FaceThumbnail":[]},{"ID":9}],"Other":1})");
    collector->writeData(7, 12, body);
    const auto* request = sentMetaInfo();
    ASSERT_NE(request, nullptr);
    EXPECT_EQ(request->type, NSNovirTunnelClient::ConfigServer);
    EXPECT_EQ(request->clientID, &client.account);
    EXPECT_TRUE(request->info.strExtra.isEmpty());
    EXPECT_EQ(request->info.strContent,
              QStringLiteral("<InputObjectMetaInfo><GroupID>7</GroupID><LocationID>12</LocationID>"
                             "<StartTime>3</StartTime><EndTime>9</EndTime><Info>"
                             R"({"ObjectMetaInfo":[{"ID":5,"LicensePlateThumbnail":[{"image":"p"}],)"
                             R"("ObjectType":"Human"},{"ID":3},{"ID":9}],"Other":1})"
                             "</Info></InputObjectMetaInfo>"));

    // Defaults keep both; an empty settings map drops both.
    collector = std::make_unique<CameraInformationCollector>(&tools);
    collector->writeData(1, 1, body);
    EXPECT_TRUE(infoOf(sentMetaInfo()->info.strContent).contains(QStringLiteral("FaceThumbnail")));
    EXPECT_TRUE(infoOf(sentMetaInfo()->info.strContent).contains(QStringLiteral("LicensePlateThumbnail")));
    collector->setDelvixSettings(QVariantMap());
    collector->writeData(1, 1, body);
    EXPECT_FALSE(infoOf(sentMetaInfo()->info.strContent).contains(QStringLiteral("Thumbnail\"")));
    EXPECT_FALSE(infoOf(sentMetaInfo()->info.strContent).contains(QStringLiteral("LicensePlate")));
}

TEST_F(CollectorTest, WriteDataSendsNothingWithoutObjects)
{
    for (const QString& body :
         {QString(), QStringLiteral("not json"), QStringLiteral(R"({"ObjectMetaInfo":[]})"),
          QStringLiteral(R"({"ObjectMetaInfo":{"ID":1}})"), QStringLiteral(R"({"Other":[1]})"),
          QStringLiteral(R"([{"ObjectMetaInfo":[{"ID":1}]}])"),
          QStringLiteral(R"({"ObjectMetaInfo":[{"ID":1}])")}) {
        collector->writeData(1, 1, body);
        EXPECT_EQ(sentMetaInfo(), nullptr) << qPrintable(body);
    }
}

TEST_F(CollectorTest, WriteDataKeepsTextSafeAndIntact)
{
    // Markup in camera text is escaped; "%1" is data; non-ASCII text survives.
    collector->writeData(
        2, 3, QString::fromUtf8(R"({"ObjectMetaInfo":[{"ID":10000000000,"PlateNumber":"京A<b>&%1"}]})"));
    const QString content = sentMetaInfo()->info.strContent;
    EXPECT_EQ(
        infoOf(content),
        QString::fromUtf8(R"({"ObjectMetaInfo":[{"ID":10000000000,"PlateNumber":"京A&lt;b&gt;&amp;%1"}]})"));
    EXPECT_TRUE(
        content.contains(QStringLiteral("<StartTime>10000000000</StartTime><EndTime>10000000000</EndTime>")));
    EXPECT_EQ(content.count(QStringLiteral("<Info>")), 1);

    // Text without markup is byte-identical to the compact JSON.
    const QString clean = QString::fromUtf8(R"({"ObjectMetaInfo":[{"ID":1,"Name":"Zoë"}]})");
    collector->writeData(2, 3, clean);
    EXPECT_EQ(infoOf(sentMetaInfo()->info.strContent).toUtf8(),
              QJsonDocument::fromJson(clean.toUtf8()).toJson(QJsonDocument::Compact));

    // Characters XML does not allow at all go out as their JSON escapes: same text, readable XML.
    const QString nonCharacters =
        QStringLiteral("{\"ObjectMetaInfo\":[{\"ID\":1,\"N\":\"a\uFFFFb\uFFFE\"}]}");
    collector->writeData(2, 3, nonCharacters);
    const QString sentText = sentMetaInfo()->info.strContent;
    EXPECT_EQ(infoOf(sentText), QStringLiteral(R"({"ObjectMetaInfo":[{"ID":1,"N":"a\uffffb\ufffe"}]})"));
    Quellon quellon;
    const QString readBack = quellon.parse(sentText)
                                 .toMap()
                                 .value(QStringLiteral("InputObjectMetaInfo"))
                                 .toMap()
                                 .value(QStringLiteral("Info"))
                                 .toString();
    EXPECT_EQ(QJsonDocument::fromJson(readBack.toUtf8()), QJsonDocument::fromJson(nonCharacters.toUtf8()));

    // An object without ID (or not an object at all) reads as 0 and goes out with ID null.
    collector->writeData(2, 3, QStringLiteral(R"({"ObjectMetaInfo":[{"ID":4},{"X":1},7]})"));
    const QString third = sentMetaInfo()->info.strContent;
    EXPECT_TRUE(third.contains(QStringLiteral("<StartTime>0</StartTime><EndTime>4</EndTime>")));
    EXPECT_EQ(infoOf(third),
              QStringLiteral(R"({"ObjectMetaInfo":[{"ID":4},{"ID":null,"X":1},{"ID":null}]})"));

    // Negative group and location numbers are written signed.
    collector->writeData(-1, -2, QStringLiteral(R"({"ObjectMetaInfo":[{"ID":1}]})"));
    EXPECT_TRUE(sentMetaInfo()->info.strContent.startsWith(
        QStringLiteral("<InputObjectMetaInfo><GroupID>-1</GroupID><LocationID>-2</LocationID>")));

    // A refused request changes nothing else.
    client.accept = false;
    const int before = client.requests.size();
    collector->writeData(2, 3, clean);
    EXPECT_EQ(client.requests.size(), before + 1);
}

TEST(CollectorWithHastyClient, AnswersArrivingDuringConstructionAreNotLost)
{
    ScriptedTunnelClient client;
    client.connectOnRegister = true;
    client.onInsert = [&client](int index) {
        const QString cmd = client.requests.at(index).cmdName;
        if (cmd == QLatin1String("GetNodeInfo")) {
            client.answer(index, true, QStringLiteral("0"),
                          QStringLiteral("<NodeInfo><Cameras><Cam><Name>A</Name><ObjectMetaRecordCap>true"
                                         "</ObjectMetaRecordCap></Cam></Cameras></NodeInfo>"));
        } else if (cmd == QLatin1String("QryLocs")) {
            client.answer(
                index, true, QStringLiteral("0"),
                QStringLiteral("<LocRecs><LocList><Live>true</Live><Loc><Alias>A</Alias><Name>Loc1</Name>"
                               "<GrpID>1</GrpID></Loc></LocList></LocRecs>"));
        } else if (cmd == QLatin1String("SubCamStatus")) {
            client.statusEvent(
                client.serverId, QString(),
                QStringLiteral("<CamStatus><Cam><Name>A</Name><ConnState>Connected</ConnState></Cam>"
                               "</CamStatus>"));
        }
    };
    FakeTools tools(&client);
    CameraInformationCollector collector(&tools);
    EXPECT_EQ(collector.cameraDirectory().keys(), QStringList{QStringLiteral("A")});
    EXPECT_EQ(collector.getCameraNodeID(QStringLiteral("Loc1")), QStringLiteral("A"));
}

TEST(CollectorWithoutClient, WorksWithoutTunnelClient)
{
    CameraInformationCollector collector(nullptr);
    collector.writeData(1, 1, QStringLiteral(R"({"ObjectMetaInfo":[{"ID":1}]})"));
    EXPECT_TRUE(collector.getCameraNodeID(QStringLiteral("Loc1")).isEmpty());
    EXPECT_FALSE(collector.getNOVIRSrvTunnelControl().isNull());
}
