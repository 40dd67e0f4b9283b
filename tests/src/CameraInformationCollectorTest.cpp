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

using namespace Qt::StringLiterals;

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
    return QVariantMap{{u"Name"_s, name},          {u"IP"_s, u"127.0.0.1"_s}, {u"Port"_s, port},
                       {u"UseSSL"_s, false},       {u"User"_s, u"u"_s},       {u"Password"_s, u"70"_s},
                       {u"DelvixProtect"_s, false}};
}

QVariantMap location(const QString& loc, int group = 1, bool recording = true)
{
    return QVariantMap{{u"Location"_s, loc}, {u"GroupID"_s, group}, {u"IsRecording"_s, recording}};
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
                             events << u"changed"_s;
                             directory = map;
                         });
        QObject::connect(collector.get(), &ICameraInformationCollector::cameraDisconnected, collector.get(),
                         [this](const QString& name) { events << u"disconnected:"_s + name; });
        QObject::connect(collector.get(), &ICameraInformationCollector::locationRemoved, collector.get(),
                         [this](const QString& name) { events << u"locationRemoved:"_s + name; });
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
        const int index = client.lastRequest(u"InputObjectMetaInfo"_s);
        return index < 0 ? nullptr : &client.requests.at(index);
    }
    QString infoOf(const QString& content) const
    {
        const qsizetype start = content.indexOf(u"<Info>"_s) + 6;
        return content.mid(start, content.lastIndexOf(u"</Info>"_s) - start);
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
    emit control->updateCameras(QVariantMap{{u"A"_s, camera(u"A"_s)}});
    emit control->updateLocations(QVariantMap{{u"A"_s, location(u"Loc1"_s)}});
    EXPECT_TRUE(directory.isEmpty()); // no status event yet
    EXPECT_EQ(events, (QStringList{u"changed"_s, u"changed"_s}));

    emit control->updateCameraStatus(u"A"_s, true);
    ASSERT_EQ(directory.keys(), QStringList{u"A"_s});
    const QVariantMap record = directory.value(u"A"_s).toMap();
    EXPECT_EQ(record.value(u"Port"_s).toInt(), 80);
    EXPECT_EQ(record.value(u"Location"_s).toString(), u"Loc1"_s);
    EXPECT_EQ(record.value(u"GroupID"_s).toInt(), 1);
    EXPECT_EQ(collector->cameraDirectory(), directory);

    events.clear();
    emit control->updateCameraStatus(u"A"_s, false);
    EXPECT_EQ(events, (QStringList{u"disconnected:A"_s, u"changed"_s}));
    EXPECT_TRUE(directory.isEmpty());

    // Unknown names change nothing but are still announced.
    events.clear();
    emit control->removeCamera(u"nobody"_s);
    EXPECT_EQ(events, QStringList{u"changed"_s});
}

TEST_F(CollectorTest, UpdatesOfOfflineOrRemovedCameras)
{
    emit control->addLocation(u"A"_s, location(u"Loc1"_s));
    emit control->updateCameraStatus(u"A"_s, false);
    emit control->updateCamera(u"A"_s, camera(u"A"_s, 81));
    EXPECT_TRUE(directory.isEmpty()); // stored, not announced
    emit control->updateCameraStatus(u"A"_s, true);
    EXPECT_EQ(directory.value(u"A"_s).toMap().value(u"Port"_s).toInt(), 81);

    // Removing the camera keeps its status and location: the next record announces it at once.
    emit control->removeCamera(u"A"_s);
    EXPECT_TRUE(directory.isEmpty());
    emit control->updateCamera(u"A"_s, camera(u"A"_s, 82));
    EXPECT_EQ(directory.value(u"A"_s).toMap().value(u"Port"_s).toInt(), 82);

    // A new camera list replaces the old one and rebuilds the directory.
    bringOnline(u"B"_s, u"Loc2"_s);
    EXPECT_EQ(directory.keys(), (QStringList{u"A"_s, u"B"_s}));
    emit control->updateCameras(QVariantMap{{u"B"_s, camera(u"B"_s)}});
    EXPECT_EQ(directory.keys(), QStringList{u"B"_s});
}

TEST_F(CollectorTest, RemovedLocationStaysWithRecordingOff)
{
    bringOnline(u"A"_s, u"Loc1"_s);
    events.clear();
    emit control->removeLocation(u"A"_s);
    EXPECT_EQ(events, (QStringList{u"locationRemoved:A"_s, u"changed"_s}));
    EXPECT_TRUE(directory.isEmpty());
    // A later merge brings it back, not recording.
    emit control->updateCameraStatus(u"A"_s, true);
    const QVariantMap back = directory.value(u"A"_s).toMap();
    EXPECT_EQ(back.value(u"Location"_s).toString(), u"Loc1"_s);
    EXPECT_EQ(back.value(u"IsRecording"_s), QVariant(false));

    // Without a location record, removal creates one that holds only the recording flag.
    emit control->updateCamera(u"B"_s, camera(u"B"_s));
    emit control->removeLocation(u"B"_s);
    emit control->updateCameraStatus(u"B"_s, true);
    const QVariantMap b = directory.value(u"B"_s).toMap();
    EXPECT_EQ(b.value(u"IsRecording"_s), QVariant(false));
    EXPECT_FALSE(b.contains(u"Location"_s));
}

TEST_F(CollectorTest, LocationValueWinsOverCameraValue)
{
    QVariantMap record = camera(u"A"_s);
    record.insert(u"GroupID"_s, 9);
    record.insert(u"Location"_s, u"LocX"_s);
    emit control->updateCamera(u"A"_s, record);
    emit control->addLocation(u"A"_s, location(u"Loc4"_s, 2));
    emit control->updateCameraStatus(u"A"_s, true);
    const QVariantMap merged = directory.value(u"A"_s).toMap();
    EXPECT_EQ(merged.value(u"GroupID"_s).toInt(), 2);
    EXPECT_EQ(merged.value(u"Location"_s).toString(), u"Loc4"_s);
    EXPECT_EQ(merged.value(u"Name"_s).toString(), u"A"_s);
}

TEST_F(CollectorTest, LocationToCameraFollowsEveryLocationChange)
{
    EXPECT_TRUE(collector->getCameraNodeID(u"Loc1"_s).isEmpty());
    emit control->updateLocations(QVariantMap{
        {u"Zed"_s, location(u"Loc1"_s)}, {u"Alpha"_s, location(u"Loc1"_s)}, {u"Mid"_s, location(u"Loc2"_s)}});
    EXPECT_EQ(collector->getCameraNodeID(u"Loc1"_s), u"Alpha"_s); // first by name
    EXPECT_EQ(collector->getCameraNodeID(u"Loc2"_s), u"Mid"_s);
    EXPECT_TRUE(collector->getCameraNodeID(u"Loc9"_s).isEmpty());
    EXPECT_TRUE(collector->getCameraNodeID(u"loc2"_s).isEmpty()); // exact match only
    emit control->addLocation(u"New"_s, location(u"Loc9"_s));
    EXPECT_EQ(collector->getCameraNodeID(u"Loc9"_s), u"New"_s);
    emit control->updateLocations(QVariantMap{{u"Mid"_s, location(u"Loc1"_s)}});
    EXPECT_EQ(collector->getCameraNodeID(u"Loc1"_s), u"Mid"_s);
    EXPECT_TRUE(collector->getCameraNodeID(u"Loc9"_s).isEmpty());
}

TEST_F(CollectorTest, LocationLookupFromRequestThreadsWhileSlotsChangeTheMap)
{
    const QVariantMap first{{u"A"_s, location(u"Loc1"_s)}, {u"B"_s, location(u"Loc2"_s)}};
    const QVariantMap second{{u"C"_s, location(u"Loc1"_s)}};
    emit control->updateLocations(first);
    std::atomic<bool> stop{false};
    std::atomic<int> wrong{0};
    std::atomic<long> lookups{0};
    std::vector<std::unique_ptr<QThread>> readers;
    for (int i = 0; i < 3; ++i) {
        readers.emplace_back(QThread::create([&]() {
            while (!stop) {
                const QString one = collector->getCameraNodeID(u"Loc1"_s);
                const QString two = collector->getCameraNodeID(u"Loc2"_s);
                if ((one != u"A"_s && one != u"C"_s) || (two != u"B"_s && !two.isEmpty())) {
                    ++wrong;
                }
                lookups += 2;
            }
        }));
        readers.back()->start();
    }
    for (int round = 0; round < 2000; ++round) {
        emit control->updateLocations(round % 2 ? first : second);
        emit control->addLocation(u"D"_s, location(u"Loc3"_s));
        emit control->removeLocation(u"D"_s);
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
    collector->setDelvixSettings(QVariantMap{{u"faceEnable"_s, false}, {u"LPREnable"_s, true}});
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
    EXPECT_TRUE(infoOf(sentMetaInfo()->info.strContent).contains(u"FaceThumbnail"_s));
    EXPECT_TRUE(infoOf(sentMetaInfo()->info.strContent).contains(u"LicensePlateThumbnail"_s));
    collector->setDelvixSettings(QVariantMap());
    collector->writeData(1, 1, body);
    EXPECT_FALSE(infoOf(sentMetaInfo()->info.strContent).contains(u"Thumbnail\""_s));
    EXPECT_FALSE(infoOf(sentMetaInfo()->info.strContent).contains(u"LicensePlate"_s));
}

TEST_F(CollectorTest, WriteDataSendsNothingWithoutObjects)
{
    for (const QString& body :
         {QString(), u"not json"_s, uR"({"ObjectMetaInfo":[]})"_s, uR"({"ObjectMetaInfo":{"ID":1}})"_s,
          uR"({"Other":[1]})"_s, uR"([{"ObjectMetaInfo":[{"ID":1}]}])"_s,
          uR"({"ObjectMetaInfo":[{"ID":1}])"_s}) {
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
    EXPECT_TRUE(content.contains(u"<StartTime>10000000000</StartTime><EndTime>10000000000</EndTime>"_s));
    EXPECT_EQ(content.count(u"<Info>"_s), 1);

    // Text without markup is byte-identical to the compact JSON.
    const QString clean = QString::fromUtf8(R"({"ObjectMetaInfo":[{"ID":1,"Name":"Zoë"}]})");
    collector->writeData(2, 3, clean);
    EXPECT_EQ(infoOf(sentMetaInfo()->info.strContent).toUtf8(),
              QJsonDocument::fromJson(clean.toUtf8()).toJson(QJsonDocument::Compact));

    // Characters XML does not allow at all go out as their JSON escapes: same text, readable XML.
    const QString nonCharacters = u"{\"ObjectMetaInfo\":[{\"ID\":1,\"N\":\"a\uFFFFb\uFFFE\"}]}"_s;
    collector->writeData(2, 3, nonCharacters);
    const QString sentText = sentMetaInfo()->info.strContent;
    EXPECT_EQ(infoOf(sentText), uR"({"ObjectMetaInfo":[{"ID":1,"N":"a\uffffb\ufffe"}]})"_s);
    Quellon quellon;
    const QString readBack =
        quellon.parse(sentText).toMap().value(u"InputObjectMetaInfo"_s).toMap().value(u"Info"_s).toString();
    EXPECT_EQ(QJsonDocument::fromJson(readBack.toUtf8()), QJsonDocument::fromJson(nonCharacters.toUtf8()));

    // An object without ID (or not an object at all) reads as 0 and goes out with ID null.
    collector->writeData(2, 3, uR"({"ObjectMetaInfo":[{"ID":4},{"X":1},7]})"_s);
    const QString third = sentMetaInfo()->info.strContent;
    EXPECT_TRUE(third.contains(u"<StartTime>0</StartTime><EndTime>4</EndTime>"_s));
    EXPECT_EQ(infoOf(third), uR"({"ObjectMetaInfo":[{"ID":4},{"ID":null,"X":1},{"ID":null}]})"_s);

    // Negative group and location numbers are written signed.
    collector->writeData(-1, -2, uR"({"ObjectMetaInfo":[{"ID":1}]})"_s);
    EXPECT_TRUE(sentMetaInfo()->info.strContent.startsWith(
        u"<InputObjectMetaInfo><GroupID>-1</GroupID><LocationID>-2</LocationID>"_s));

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
            client.answer(index, true, u"0"_s,
                          QStringLiteral("<NodeInfo><Cameras><Cam><Name>A</Name><ObjectMetaRecordCap>true"
                                         "</ObjectMetaRecordCap></Cam></Cameras></NodeInfo>"));
        } else if (cmd == QLatin1String("QryLocs")) {
            client.answer(
                index, true, u"0"_s,
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
    EXPECT_EQ(collector.cameraDirectory().keys(), QStringList{u"A"_s});
    EXPECT_EQ(collector.getCameraNodeID(u"Loc1"_s), u"A"_s);
}

TEST(CollectorWithoutClient, WorksWithoutTunnelClient)
{
    CameraInformationCollector collector(nullptr);
    collector.writeData(1, 1, uR"({"ObjectMetaInfo":[{"ID":1}]})"_s);
    EXPECT_TRUE(collector.getCameraNodeID(u"Loc1"_s).isEmpty());
    EXPECT_FALSE(collector.getNOVIRSrvTunnelControl().isNull());
}
