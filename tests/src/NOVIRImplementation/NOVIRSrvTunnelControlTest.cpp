// The tunnel control against a client the test scripts: what it registers and sends, how it
// turns answers (through its two parsers), broadcasts and events into signals.
#include "NOVIRImplementation/NOVIRSrvTunnelControl.h"
#include "ScriptedTunnelClient.h"

#include <QFile>
#include <QSignalSpy>
#include <gtest/gtest.h>
#include <memory>

namespace {

using NSNovirTunnelClient::ConfigServer;
using NSNovirTunnelClient::LocationServer;

const QString kGetNodeInfo = QStringLiteral("GetNodeInfo");
const QString kQryLocs = QStringLiteral("QryLocs");
const QString kSubCamStatus = QStringLiteral("SubCamStatus");
const QString kPluginId = QStringLiteral("d2792a6a286548ecb47417172e5e5fa7");

QString readData(const char* name)
{
    QFile file(QStringLiteral(NOVIR_TEST_DATA "/") + QLatin1String(name));
    EXPECT_TRUE(file.open(QIODevice::ReadOnly)) << name;
    return QString::fromUtf8(file.readAll());
}

QString camXml(const QString& name, int port = 80)
{
    return QStringLiteral(
               "<Cam><Name>%1</Name><Port>%2</Port><ObjectMetaRecordCap>true</ObjectMetaRecordCap></Cam>")
        .arg(name)
        .arg(port);
}

QString nodeInfo(const QStringList& cams)
{
    return QStringLiteral("<NodeInfo><Cameras>") + cams.join(QString()) +
           QStringLiteral("</Cameras></NodeInfo>");
}

QString locXml(const QString& alias, const QString& location, int group = 1)
{
    return QStringLiteral("<Loc><Alias>%1</Alias><Name>%2</Name><GrpID>%3</GrpID></Loc>")
        .arg(alias, location)
        .arg(group);
}

QString locRecs(const QString& live, const QStringList& locs)
{
    return QStringLiteral("<LocRecs><LocList><Live>%1</Live>%2</LocList></LocRecs>")
        .arg(live, locs.join(QString()));
}

class TunnelControlTest : public ::testing::Test
{
protected:
    void SetUp() override { control = std::make_unique<NOVIRSrvTunnelControl>(&client); }

    // Brings the configuration server up and answers the all-cameras request with text.
    QVariantMap camerasOf(const QString& answer)
    {
        QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::updateCameras);
        client.connectServer(ConfigServer);
        client.answer(client.lastRequest(kGetNodeInfo), true, QStringLiteral("0"), answer);
        EXPECT_EQ(spy.count(), 1);
        return spy.isEmpty() ? QVariantMap() : spy.last().at(0).toMap();
    }
    QVariantMap locationsOf(const QString& answer)
    {
        QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::updateLocations);
        client.connectServer(LocationServer);
        client.answer(client.lastRequest(kQryLocs), true, QStringLiteral("0"), answer);
        EXPECT_EQ(spy.count(), 1);
        return spy.isEmpty() ? QVariantMap() : spy.last().at(0).toMap();
    }

    ScriptedTunnelClient client; // outlives the control, as the host's client does
    std::unique_ptr<NOVIRSrvTunnelControl> control;
};

} // namespace

TEST_F(TunnelControlTest, ConstructionRegistersOnlyTheConnectionHandler)
{
    ASSERT_EQ(client.connectRegistrations.size(), 1);
    EXPECT_EQ(client.connectRegistrations.first().pluginId, kPluginId);
    EXPECT_EQ(client.connectRegistrations.first().type, NSNovirTunnelClient::ConnectStatus);
    EXPECT_TRUE(client.requests.isEmpty());
    EXPECT_TRUE(client.broadcastRegistrations.isEmpty());
}

TEST(TunnelControlWithoutClient, EveryOperationFailsQuietly)
{
    NOVIRSrvTunnelControl control(nullptr);
    EXPECT_FALSE(
        control.sendRequest(nullptr, QStringLiteral("X"), QString(), QString(), nullptr, ConfigServer));
    EXPECT_EQ(control.getServerAccountID(), nullptr);
    EXPECT_FALSE(control.registerBroadcastHandler(nullptr));
    EXPECT_FALSE(control.registerEventHandler(nullptr, QStringLiteral("E"), ConfigServer));
}

TEST_F(TunnelControlTest, ConnectionsStartTheirWorkInOrder)
{
    client.connectServer(ConfigServer, false);
    client.connectServer(LocationServer, false);
    client.connectServer(static_cast<NSNovirTunnelClient::ServerType>(2));
    EXPECT_TRUE(client.requests.isEmpty());

    client.connectServer(ConfigServer);
    const QStringList expectedBroadcasts = {QStringLiteral("CamIns"), QStringLiteral("CamRmv"),
                                            QStringLiteral("CamInfoChange"), QStringLiteral("ChannelAdd"),
                                            QStringLiteral("ChannelRmv")};
    ASSERT_EQ(client.broadcastRegistrations.size(), expectedBroadcasts.size());
    for (int i = 0; i < expectedBroadcasts.size(); ++i) {
        EXPECT_EQ(client.broadcastRegistrations.at(i).name, expectedBroadcasts.at(i));
        EXPECT_EQ(client.broadcastRegistrations.at(i).type, ConfigServer);
        EXPECT_EQ(client.broadcastRegistrations.at(i).pluginId, kPluginId);
    }
    ASSERT_EQ(client.requests.size(), 2);
    const auto& all = client.requests.at(0);
    EXPECT_EQ(all.cmdName, kGetNodeInfo);
    EXPECT_EQ(all.type, ConfigServer);
    EXPECT_EQ(all.pluginId, kPluginId);
    EXPECT_EQ(all.clientID, &client.account);
    EXPECT_EQ(all.info.nPriority, 0);
    EXPECT_EQ(all.info.nTimeoutMs, 15000);
    EXPECT_EQ(all.info.strContent, QStringLiteral("<GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>"));
    EXPECT_TRUE(all.info.strExtra.isEmpty());
    const auto& subscribe = client.requests.at(1);
    EXPECT_EQ(subscribe.cmdName, kSubCamStatus);
    EXPECT_TRUE(subscribe.subscribe);
    EXPECT_EQ(subscribe.serverId, QStringLiteral("srv-1"));
    EXPECT_EQ(subscribe.info.strContent, QStringLiteral("<SubCamStatus><SID>srv-1</SID></SubCamStatus>"));

    client.connectServer(LocationServer);
    ASSERT_EQ(client.requests.size(), 3);
    EXPECT_EQ(client.requests.at(2).cmdName, kQryLocs);
    EXPECT_EQ(client.requests.at(2).type, LocationServer);
    EXPECT_EQ(client.requests.at(2).info.strContent,
              QStringLiteral("<QryLocs><LiveOnly>false</LiveOnly></QryLocs>"));

    // A new connection repeats the steps.
    client.connectServer(ConfigServer);
    EXPECT_EQ(client.countRequests(kGetNodeInfo), 2);
    EXPECT_EQ(client.countRequests(kSubCamStatus), 2);
}

TEST_F(TunnelControlTest, NodeInfoParserAppliesCapabilityPortChannelAndProtectionRules)
{
    const QVariantMap cameras = camerasOf(readData("nodeinfo_edge_cases.xml"));
    const QStringList expectedNames = {
        QStringLiteral("Dup"),           QStringLiteral("HostileChannel"), QStringLiteral("Multi0"),
        QStringLiteral("Multi3"),        QStringLiteral("MultiNoChannel"), QStringLiteral("Plain"),
        QStringLiteral("SingleChannel"), QStringLiteral("Sparse"),         QStringLiteral("SslNoPort"),
        QStringLiteral("SslWithPort")};
    EXPECT_EQ(cameras.keys(), expectedNames);

    const QVariantMap plain = cameras.value(QStringLiteral("Plain")).toMap();
    const QStringList recordKeys = {QStringLiteral("DelvixProtect"), QStringLiteral("IP"),
                                    QStringLiteral("Name"),          QStringLiteral("Password"),
                                    QStringLiteral("Port"),          QStringLiteral("UseSSL"),
                                    QStringLiteral("User")};
    EXPECT_EQ(plain.keys(), recordKeys);
    EXPECT_EQ(plain.value(QStringLiteral("Name")).toString(), QStringLiteral("Plain"));
    EXPECT_EQ(plain.value(QStringLiteral("IP")).toString(), QStringLiteral("127.0.0.1"));
    EXPECT_EQ(plain.value(QStringLiteral("Port")), QVariant(8080)); // SSL off: HTTPSPort ignored
    EXPECT_EQ(plain.value(QStringLiteral("UseSSL")), QVariant(false));
    EXPECT_EQ(plain.value(QStringLiteral("User")).toString(), QStringLiteral("admin"));
    EXPECT_EQ(plain.value(QStringLiteral("Password")).toString(), QStringLiteral("736563726574"));
    EXPECT_EQ(plain.value(QStringLiteral("DelvixProtect")), QVariant(false));

    const QVariantMap sslWithPort = cameras.value(QStringLiteral("SslWithPort")).toMap();
    EXPECT_EQ(sslWithPort.value(QStringLiteral("Port")).toInt(), 8443);
    EXPECT_EQ(sslWithPort.value(QStringLiteral("UseSSL")), QVariant(true));
    EXPECT_EQ(sslWithPort.value(QStringLiteral("DelvixProtect")), QVariant(true));
    const QVariantMap sslNoPort = cameras.value(QStringLiteral("SslNoPort")).toMap();
    EXPECT_EQ(sslNoPort.value(QStringLiteral("Port")).toInt(), 443);
    EXPECT_EQ(sslNoPort.value(QStringLiteral("DelvixProtect")), QVariant(false));

    auto channelOf = [&](const char* name) {
        return cameras.value(QLatin1String(name)).toMap().value(QStringLiteral("MultiChannelID"));
    };
    EXPECT_EQ(channelOf("Multi3"), QVariant(2));
    EXPECT_EQ(channelOf("Multi0"), QVariant(0));
    EXPECT_EQ(channelOf("MultiNoChannel"), QVariant(0));
    EXPECT_EQ(channelOf("HostileChannel"), QVariant(0));
    EXPECT_FALSE(channelOf("SingleChannel").isValid());
    EXPECT_FALSE(channelOf("Plain").isValid());

    EXPECT_EQ(cameras.value(QStringLiteral("Dup")).toMap().value(QStringLiteral("Port")).toInt(), 2);
    const QVariantMap sparse = cameras.value(QStringLiteral("Sparse")).toMap();
    EXPECT_EQ(sparse.keys(), recordKeys);
    EXPECT_FALSE(sparse.value(QStringLiteral("IP")).isValid());
    EXPECT_FALSE(sparse.value(QStringLiteral("User")).isValid());
    EXPECT_FALSE(sparse.value(QStringLiteral("Password")).isValid());
    EXPECT_EQ(sparse.value(QStringLiteral("Port")), QVariant(0));
}

TEST_F(TunnelControlTest, SingleCamAndHostileShapesAreHandled)
{
    const QVariantMap single = camerasOf(readData("nodeinfo_single.xml"));
    ASSERT_EQ(single.keys(), QStringList{QStringLiteral("Only")});
    EXPECT_EQ(single.value(QStringLiteral("Only")).toMap().value(QStringLiteral("Port")).toInt(), 18081);

    // Elements where texts are expected, texts where elements are expected: no foreign trees in
    // records, no crash.
    const QVariantMap odd = camerasOf(QStringLiteral(
        "<NodeInfo><Cameras><Cam><Name>N</Name><IP><Deep>x</Deep></IP><User>a</User><User>b</User>"
        "<ObjectMetaRecordCap>true</ObjectMetaRecordCap></Cam><Cam>text</Cam></Cameras></NodeInfo>"));
    ASSERT_EQ(odd.keys(), QStringList{QStringLiteral("N")});
    EXPECT_EQ(odd.value(QStringLiteral("N")).toMap().value(QStringLiteral("IP")).typeId(),
              QMetaType::QString);
    EXPECT_EQ(odd.value(QStringLiteral("N")).toMap().value(QStringLiteral("User")).typeId(),
              QMetaType::QString);
    EXPECT_TRUE(camerasOf(QStringLiteral("<NodeInfo>flat</NodeInfo>")).isEmpty());
    EXPECT_TRUE(camerasOf(QStringLiteral("<Other><Cameras>") + camXml(QStringLiteral("x")) +
                          QStringLiteral("</Cameras></Other>"))
                    .isEmpty());
}

TEST_F(TunnelControlTest, AnswerFailureRuleAppliesToEveryCallback)
{
    QSignalSpy cameras(control.get(), &NOVIRSrvTunnelControl::updateCameras);
    QSignalSpy camera(control.get(), &NOVIRSrvTunnelControl::updateCamera);
    QSignalSpy locations(control.get(), &NOVIRSrvTunnelControl::updateLocations);
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    const int all = client.lastRequest(kGetNodeInfo);
    client.answer(all, false, QStringLiteral("-1"), nodeInfo({camXml(QStringLiteral("A"))}));
    EXPECT_EQ(cameras.count(), 0);
    client.answer(all, false, QStringLiteral("0"), nodeInfo({camXml(QStringLiteral("A"))}));
    ASSERT_EQ(cameras.count(), 1);
    EXPECT_TRUE(cameras.last().at(0).toMap().contains(QStringLiteral("A")));

    const int locs = client.lastRequest(kQryLocs);
    client.answer(locs, false, QStringLiteral("-1"),
                  locRecs(QStringLiteral("true"), {locXml(QStringLiteral("A"), QStringLiteral("Loc1"))}));
    EXPECT_EQ(locations.count(), 0); // a failed last part is dropped, finish flag and all
    client.answer(locs, false, QStringLiteral("0"),
                  locRecs(QStringLiteral("true"), {locXml(QStringLiteral("A"), QStringLiteral("Loc1"))}));
    ASSERT_EQ(locations.count(), 1);
    EXPECT_TRUE(locations.last().at(0).toMap().contains(QStringLiteral("A")));

    client.broadcast(QStringLiteral("CamIns"), QString(),
                     QStringLiteral("<CamIns><Entry><Name>B</Name></Entry></CamIns>"));
    const int one = client.lastRequest(kGetNodeInfo);
    ASSERT_NE(one, all);
    client.answer(one, false, QStringLiteral("-2"), nodeInfo({camXml(QStringLiteral("B"))}));
    EXPECT_EQ(camera.count(), 0);
    client.answer(one, false, QStringLiteral("0"), nodeInfo({camXml(QStringLiteral("B"))}));
    EXPECT_EQ(camera.count(), 1);
}

TEST_F(TunnelControlTest, AllCamerasInPartsAnnounceEverythingReceivedSoFar)
{
    QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::updateCameras);
    client.connectServer(ConfigServer);
    const int all = client.lastRequest(kGetNodeInfo);
    client.answer(all, true, QStringLiteral("0"),
                  nodeInfo({camXml(QStringLiteral("A")), camXml(QStringLiteral("B"))}), false);
    client.answer(all, true, QStringLiteral("0"), QStringLiteral("<NodeInfo><Cameras>"),
                  false); // unparseable
    client.answer(all, true, QStringLiteral("0"),
                  nodeInfo({camXml(QStringLiteral("C")), camXml(QStringLiteral("B"), 99)}), true);
    ASSERT_EQ(spy.count(), 3);
    EXPECT_EQ(spy.at(0).at(0).toMap().keys(), (QStringList{QStringLiteral("A"), QStringLiteral("B")}));
    EXPECT_EQ(spy.at(1).at(0).toMap().keys(), (QStringList{QStringLiteral("A"), QStringLiteral("B")}));
    const QVariantMap last = spy.at(2).at(0).toMap();
    EXPECT_EQ(last.keys(), (QStringList{QStringLiteral("A"), QStringLiteral("B"), QStringLiteral("C")}));
    EXPECT_EQ(last.value(QStringLiteral("B")).toMap().value(QStringLiteral("Port")).toInt(), 99);

    // A second answer starts from nothing; an unconvertible first part announces an empty map.
    client.connectServer(ConfigServer);
    client.answer(client.lastRequest(kGetNodeInfo), true, QStringLiteral("0"), QStringLiteral("not xml"));
    ASSERT_EQ(spy.count(), 4);
    EXPECT_TRUE(spy.at(3).at(0).toMap().isEmpty());
}

TEST_F(TunnelControlTest, LocationPartsMergeLaterPartWinsOneAnnouncementAtFinish)
{
    QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::updateLocations);
    client.connectServer(LocationServer);
    const int locs = client.lastRequest(kQryLocs);
    client.answer(locs, true, QStringLiteral("0"),
                  locRecs(QStringLiteral("true"), {locXml(QStringLiteral("A"), QStringLiteral("Loc1")),
                                                   locXml(QStringLiteral("B"), QStringLiteral("Loc2"))}),
                  false);
    client.answer(locs, true, QStringLiteral("0"), QStringLiteral("<LocRecs>"), false);
    client.answer(locs, true, QStringLiteral("0"),
                  locRecs(QStringLiteral("false"), {locXml(QStringLiteral("B"), QStringLiteral("Loc7"), 5)}),
                  false);
    EXPECT_EQ(spy.count(), 0);
    client.answer(locs, true, QStringLiteral("0"),
                  locRecs(QStringLiteral("true"), {locXml(QStringLiteral("C"), QStringLiteral("Loc3"))}),
                  true);
    ASSERT_EQ(spy.count(), 1);
    const QVariantMap map = spy.at(0).at(0).toMap();
    EXPECT_EQ(map.keys(), (QStringList{QStringLiteral("A"), QStringLiteral("B"), QStringLiteral("C")}));
    const QVariantMap b = map.value(QStringLiteral("B")).toMap();
    EXPECT_EQ(b.value(QStringLiteral("Location")).toString(), QStringLiteral("Loc7"));
    EXPECT_EQ(b.value(QStringLiteral("GroupID")).toInt(), 5);
    EXPECT_EQ(b.value(QStringLiteral("IsRecording")).toString(), QStringLiteral("false"));

    // A second location connection clears what was collected before asking again.
    client.connectServer(LocationServer);
    client.answer(client.lastRequest(kQryLocs), true, QStringLiteral("0"),
                  locRecs(QStringLiteral("true"), {locXml(QStringLiteral("D"), QStringLiteral("Loc4"))}));
    ASSERT_EQ(spy.count(), 2);
    EXPECT_EQ(spy.at(1).at(0).toMap().keys(), QStringList{QStringLiteral("D")});

    // An unconvertible finished part adds nothing but still announces.
    client.connectServer(LocationServer);
    client.answer(client.lastRequest(kQryLocs), true, QStringLiteral("0"), QStringLiteral("<broken"));
    ASSERT_EQ(spy.count(), 3);
    EXPECT_TRUE(spy.at(2).at(0).toMap().isEmpty());
}

TEST_F(TunnelControlTest, LocationParserLiveAliasAndRecordShape)
{
    const QVariantMap map = locationsOf(readData("locations_two_lists.xml"));
    EXPECT_EQ(map.keys(), (QStringList{QString(), QStringLiteral("CamA"), QStringLiteral("CamB"),
                                       QStringLiteral("CamC"), QStringLiteral("Repeated")}));
    const QVariantMap a = map.value(QStringLiteral("CamA")).toMap();
    EXPECT_EQ(a.keys(), (QStringList{QStringLiteral("GroupID"), QStringLiteral("IsRecording"),
                                     QStringLiteral("Location")}));
    EXPECT_EQ(a.value(QStringLiteral("Location")).toString(), QStringLiteral("Loc1"));
    EXPECT_EQ(a.value(QStringLiteral("IsRecording")).toString(), QStringLiteral("true"));
    EXPECT_TRUE(a.value(QStringLiteral("IsRecording")).toBool());
    EXPECT_EQ(map.value(QStringLiteral("CamC")).toMap().value(QStringLiteral("IsRecording")).toString(),
              QStringLiteral("false"));
    EXPECT_FALSE(map.value(QStringLiteral("CamC")).toMap().value(QStringLiteral("IsRecording")).toBool());
    EXPECT_EQ(map.value(QString()).toMap().value(QStringLiteral("Location")).toString(),
              QStringLiteral("Loc4"));
    EXPECT_EQ(map.value(QStringLiteral("Repeated")).toMap().value(QStringLiteral("Location")).toString(),
              QStringLiteral("Loc9"));
}

TEST_F(TunnelControlTest, BroadcastsBecomeRequestsOrSignals)
{
    QSignalSpy cameras(control.get(), &NOVIRSrvTunnelControl::updateCameras);
    QSignalSpy camera(control.get(), &NOVIRSrvTunnelControl::updateCamera);
    QSignalSpy removed(control.get(), &NOVIRSrvTunnelControl::removeCamera);
    QSignalSpy added(control.get(), &NOVIRSrvTunnelControl::addLocation);
    QSignalSpy locationRemoved(control.get(), &NOVIRSrvTunnelControl::removeLocation);
    client.connectServer(ConfigServer);
    const int before = client.requests.size();

    client.broadcast(QStringLiteral("CamIns"), QString(),
                     QStringLiteral("<CamIns><Entry><Name>New &amp; &lt;Cam&gt;</Name></Entry></CamIns>"));
    ASSERT_EQ(client.requests.size(), before + 1);
    EXPECT_EQ(client.requests.last().cmdName, kGetNodeInfo);
    EXPECT_EQ(client.requests.last().info.strContent,
              QStringLiteral("<GetNodeInfo><Node>New &amp; &lt;Cam&gt;</Node></GetNodeInfo>"));
    client.answer(client.requests.size() - 1, true, QStringLiteral("0"),
                  nodeInfo({camXml(QStringLiteral("X")), camXml(QStringLiteral("W"))}));
    ASSERT_EQ(camera.count(), 2);
    EXPECT_EQ(camera.at(0).at(0).toString(), QStringLiteral("W")); // key order
    EXPECT_EQ(camera.at(1).at(0).toString(), QStringLiteral("X"));
    EXPECT_EQ(camera.at(1).at(1).toMap().value(QStringLiteral("Name")).toString(), QStringLiteral("X"));
    EXPECT_EQ(cameras.count(), 0);

    client.broadcast(QStringLiteral("CamInfoChange"), QString(),
                     QStringLiteral("<CamInfoChange><Cam>Lobby</Cam></CamInfoChange>"));
    EXPECT_EQ(client.requests.last().info.strContent,
              QStringLiteral("<GetNodeInfo><Node>Lobby</Node></GetNodeInfo>"));
    // An answer to another command through the same callback is ignored.
    client.requests.last().info.respCB(true, kSubCamStatus, QString(), QStringLiteral("0"),
                                       nodeInfo({camXml(QStringLiteral("Z"))}), true);
    EXPECT_EQ(camera.count(), 2);

    client.broadcast(QStringLiteral("CamRmv"), QString(), QStringLiteral("<CamRm><Name>Gone</Name></CamRm>"));
    ASSERT_EQ(removed.count(), 1);
    EXPECT_EQ(removed.at(0).at(0).toString(), QStringLiteral("Gone"));

    client.broadcast(
        QStringLiteral("ChannelAdd"), QString(),
        QStringLiteral("<ChannelAdd><CamName>Lobby</CamName><Loc>Loc12</Loc><GrpID>3</GrpID></ChannelAdd>"));
    ASSERT_EQ(added.count(), 1);
    EXPECT_EQ(added.at(0).at(0).toString(), QStringLiteral("Lobby"));
    const QVariantMap location = added.at(0).at(1).toMap();
    EXPECT_EQ(location.value(QStringLiteral("Location")), QVariant(QStringLiteral("Loc12")));
    EXPECT_EQ(location.value(QStringLiteral("GroupID")).typeId(), QMetaType::Int);
    EXPECT_EQ(location.value(QStringLiteral("GroupID")).toInt(), 3);
    EXPECT_EQ(location.value(QStringLiteral("IsRecording")), QVariant(true));

    client.broadcast(QStringLiteral("ChannelRmv"), QString(),
                     QStringLiteral("<ChannelRmv><CamName>Lobby</CamName></ChannelRmv>"));
    ASSERT_EQ(locationRemoved.count(), 1);
    EXPECT_EQ(locationRemoved.at(0).at(0).toString(), QStringLiteral("Lobby"));

    // Relayed, malformed and unknown broadcasts change nothing.
    const int requests = client.requests.size();
    client.broadcast(QStringLiteral("CamRmv"), QStringLiteral("relay/1"),
                     QStringLiteral("<CamRm><Name>Gone</Name></CamRm>"));
    client.broadcast(QStringLiteral("CamIns"), QStringLiteral("relay/1"),
                     QStringLiteral("<CamIns><Entry><Name>R</Name></Entry></CamIns>"));
    client.broadcast(QStringLiteral("ChannelRmv"), QString(), QStringLiteral("<ChannelRmv><CamName>"));
    client.broadcast(QStringLiteral("CamIns"), QString(), QStringLiteral("<CamIns"));
    EXPECT_EQ(removed.count(), 1);
    EXPECT_EQ(locationRemoved.count(), 1);
    EXPECT_EQ(client.requests.size(), requests);
}

TEST_F(TunnelControlTest, CameraStatusEventsFromTheServerOnly)
{
    QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::updateCameraStatus);
    client.connectServer(ConfigServer);
    client.statusEvent(
        QStringLiteral("srv-1"), QString(),
        QStringLiteral("<CamStatus><Cam><Name>A</Name><ConnState>Connected</ConnState></Cam>"
                       "<Cam><Name>B</Name><ConnState>Disconnected</ConnState></Cam>"
                       "<Cam><Name>C</Name><ConnState>connected</ConnState></Cam></CamStatus>"));
    ASSERT_EQ(spy.count(), 3);
    EXPECT_EQ(spy.at(0).at(0).toString(), QStringLiteral("A"));
    EXPECT_TRUE(spy.at(0).at(1).toBool());
    EXPECT_FALSE(spy.at(1).at(1).toBool());
    EXPECT_FALSE(spy.at(2).at(1).toBool()); // exact text only
    client.statusEvent(
        QStringLiteral("srv-1"), QString(),
        QStringLiteral("<CamStatus><Cam><Name>D</Name><ConnState>Connected</ConnState></Cam></CamStatus>"));
    ASSERT_EQ(spy.count(), 4);
    EXPECT_EQ(spy.at(3).at(0).toString(), QStringLiteral("D"));

    const QString event =
        QStringLiteral("<CamStatus><Cam><Name>E</Name><ConnState>Connected</ConnState></Cam></CamStatus>");
    client.statusEvent(QStringLiteral("other"), QString(), event);
    client.statusEvent(QStringLiteral("srv-1"), QStringLiteral("relay/2"), event);
    client.statusEvent(QStringLiteral("srv-1"), QString(), QString());
    client.statusEvent(QStringLiteral("srv-1"), QString(), QStringLiteral("<CamStatus><Cam>"));
    EXPECT_EQ(spy.count(), 4);
}

TEST_F(TunnelControlTest, ServerIdIsEscapedInTheSubscription)
{
    client.serverId = QStringLiteral("a<b>&c");
    client.connectServer(ConfigServer);
    const auto& subscribe = client.requests.at(client.lastRequest(kSubCamStatus));
    EXPECT_EQ(subscribe.info.strContent,
              QStringLiteral("<SubCamStatus><SID>a&lt;b&gt;&amp;c</SID></SubCamStatus>"));
    EXPECT_EQ(subscribe.serverId, QStringLiteral("a<b>&c"));
}

TEST_F(TunnelControlTest, SendRequestRelaysEveryPartAndEventsAreForwarded)
{
    QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::reqResp);
    int context = 0;
    ASSERT_TRUE(control->sendRequest(&client.account, QStringLiteral("Custom"), QStringLiteral("<C/>"),
                                     QStringLiteral("extra"), &context, ConfigServer));
    const auto& request = client.requests.last();
    EXPECT_EQ(request.cmdName, QStringLiteral("Custom"));
    EXPECT_EQ(request.info.strExtra, QStringLiteral("extra"));
    EXPECT_EQ(request.info.strContent, QStringLiteral("<C/>"));
    request.info.respCB(false, QStringLiteral("Custom"), QStringLiteral("r/1"), QStringLiteral("-1"),
                        QStringLiteral("no"), false);
    request.info.respCB(true, QStringLiteral("Custom"), QString(), QStringLiteral("0"), QStringLiteral("yes"),
                        true);
    ASSERT_EQ(spy.count(), 2);
    EXPECT_FALSE(spy.at(0).at(0).toBool());
    EXPECT_FALSE(spy.at(0).at(1).toBool());
    EXPECT_EQ(spy.at(0).at(2).toString(), QStringLiteral("no"));
    EXPECT_EQ(spy.at(0).at(3).toString(), QStringLiteral("r/1"));
    EXPECT_EQ(spy.at(0).at(4).value<void*>(), &context);
    EXPECT_EQ(spy.at(0).at(5).toString(), QStringLiteral("-1"));
    EXPECT_TRUE(spy.at(1).at(1).toBool());

    control->hdlrReqResp(true, QStringLiteral("X"), QStringLiteral("p"), QStringLiteral("0"),
                         QStringLiteral("t"), true, nullptr, &context);
    ASSERT_EQ(spy.count(), 3);
    EXPECT_EQ(spy.at(2).at(4).value<void*>(), &context);

    client.accept = false;
    EXPECT_FALSE(control->sendRequest(&client.account, QStringLiteral("Custom"), QString(), QString(),
                                      nullptr, ConfigServer));

    QSignalSpy events(control.get(), &NOVIRSrvTunnelControl::evtResp);
    ASSERT_TRUE(control->registerEventHandler(&client.account, QStringLiteral("Evt"), ConfigServer));
    ASSERT_EQ(client.eventRegistrations.size(), 1);
    EXPECT_EQ(client.eventRegistrations.first().name, QStringLiteral("Evt"));
    client.eventHandlers.first()(client.handleOf(ConfigServer), QStringLiteral("src"), QStringLiteral("Evt"),
                                 ConfigServer, QStringLiteral("relay"), QStringLiteral("<M/>"));
    ASSERT_EQ(events.count(), 1);
    EXPECT_EQ(events.at(0).at(1).toString(), QStringLiteral("relay"));
    EXPECT_EQ(events.at(0).at(2).toString(), QStringLiteral("<M/>"));
}

TEST_F(TunnelControlTest, LateCallbacksAfterDestructionFindTheGuard)
{
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    int context = 0;
    control->sendRequest(&client.account, QStringLiteral("Custom"), QString(), QString(), &context,
                         ConfigServer);
    control.reset();
    // Every handler and callback the client still holds now meets a revoked guard.
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    for (int i = 0; i < client.requests.size(); ++i) {
        client.answer(i, true, QStringLiteral("0"), nodeInfo({camXml(QStringLiteral("A"))}));
    }
    client.broadcast(QStringLiteral("CamIns"), QString(),
                     QStringLiteral("<CamIns><Entry><Name>B</Name></Entry></CamIns>"));
    client.statusEvent(QStringLiteral("srv-1"), QString(), QStringLiteral("<CamStatus/>"));
    EXPECT_EQ(client.countRequests(kGetNodeInfo), 1); // nothing was sent on behalf of the dead control
    EXPECT_EQ(client.countRequests(kQryLocs), 1);
}
