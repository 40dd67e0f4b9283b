// The tunnel control against a client the test scripts: what it registers and sends, how it
// turns answers (through its two parsers), broadcasts and events into signals.
#include "NOVIRImplementation/NOVIRSrvTunnelControl.h"
#include "ScriptedTunnelClient.h"

#include <QFile>
#include <QSignalSpy>
#include <gtest/gtest.h>
#include <memory>

using namespace Qt::StringLiterals;

namespace {

using NSNovirTunnelClient::ConfigServer;
using NSNovirTunnelClient::LocationServer;

const QString kGetNodeInfo = u"GetNodeInfo"_s;
const QString kQryLocs = u"QryLocs"_s;
const QString kSubCamStatus = u"SubCamStatus"_s;
const QString kPluginId = u"d2792a6a286548ecb47417172e5e5fa7"_s;

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
    return u"<NodeInfo><Cameras>"_s + cams.join(QString()) + u"</Cameras></NodeInfo>"_s;
}

QString locXml(const QString& alias, const QString& location, int group = 1)
{
    return u"<Loc><Alias>%1</Alias><Name>%2</Name><GrpID>%3</GrpID></Loc>"_s.arg(alias, location).arg(group);
}

QString locRecs(const QString& live, const QStringList& locs)
{
    return u"<LocRecs><LocList><Live>%1</Live>%2</LocList></LocRecs>"_s.arg(live, locs.join(QString()));
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
        client.answer(client.lastRequest(kGetNodeInfo), true, u"0"_s, answer);
        EXPECT_EQ(spy.count(), 1);
        return spy.isEmpty() ? QVariantMap() : spy.last().at(0).toMap();
    }
    QVariantMap locationsOf(const QString& answer)
    {
        QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::updateLocations);
        client.connectServer(LocationServer);
        client.answer(client.lastRequest(kQryLocs), true, u"0"_s, answer);
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
    EXPECT_FALSE(control.sendRequest(nullptr, u"X"_s, QString(), QString(), nullptr, ConfigServer));
    EXPECT_EQ(control.getServerAccountID(), nullptr);
    EXPECT_FALSE(control.registerBroadcastHandler(nullptr));
    EXPECT_FALSE(control.registerEventHandler(nullptr, u"E"_s, ConfigServer));
}

TEST_F(TunnelControlTest, ConnectionsStartTheirWorkInOrder)
{
    client.connectServer(ConfigServer, false);
    client.connectServer(LocationServer, false);
    client.connectServer(static_cast<NSNovirTunnelClient::ServerType>(2));
    EXPECT_TRUE(client.requests.isEmpty());

    client.connectServer(ConfigServer);
    const QStringList expectedBroadcasts = {u"CamIns"_s, u"CamRmv"_s, u"CamInfoChange"_s, u"ChannelAdd"_s,
                                            u"ChannelRmv"_s};
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
    EXPECT_EQ(all.info.strContent, u"<GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>"_s);
    EXPECT_TRUE(all.info.strExtra.isEmpty());
    const auto& subscribe = client.requests.at(1);
    EXPECT_EQ(subscribe.cmdName, kSubCamStatus);
    EXPECT_TRUE(subscribe.subscribe);
    EXPECT_EQ(subscribe.serverId, u"srv-1"_s);
    EXPECT_EQ(subscribe.info.strContent, u"<SubCamStatus><SID>srv-1</SID></SubCamStatus>"_s);

    client.connectServer(LocationServer);
    ASSERT_EQ(client.requests.size(), 3);
    EXPECT_EQ(client.requests.at(2).cmdName, kQryLocs);
    EXPECT_EQ(client.requests.at(2).type, LocationServer);
    EXPECT_EQ(client.requests.at(2).info.strContent, u"<QryLocs><LiveOnly>false</LiveOnly></QryLocs>"_s);

    // A new connection repeats the steps.
    client.connectServer(ConfigServer);
    EXPECT_EQ(client.countRequests(kGetNodeInfo), 2);
    EXPECT_EQ(client.countRequests(kSubCamStatus), 2);

    // The server id is escaped in the subscription text, and passed on as it is.
    client.serverId = u"a<b>&c"_s;
    client.connectServer(ConfigServer);
    const auto& escaped = client.requests.at(client.lastRequest(kSubCamStatus));
    EXPECT_EQ(escaped.info.strContent, u"<SubCamStatus><SID>a&lt;b&gt;&amp;c</SID></SubCamStatus>"_s);
    EXPECT_EQ(escaped.serverId, u"a<b>&c"_s);
}

TEST_F(TunnelControlTest, NodeInfoParserAppliesCapabilityPortChannelAndProtectionRules)
{
    const QVariantMap cameras = camerasOf(readData("nodeinfo_edge_cases.xml"));
    const QStringList expectedNames = {
        u"Dup"_s,   u"HostileChannel"_s, u"Multi0"_s, u"Multi3"_s,    u"MultiNoChannel"_s,
        u"Plain"_s, u"SingleChannel"_s,  u"Sparse"_s, u"SslNoPort"_s, u"SslWithPort"_s};
    EXPECT_EQ(cameras.keys(), expectedNames);

    const QStringList recordKeys = {u"DelvixProtect"_s, u"IP"_s,     u"Name"_s, u"Password"_s,
                                    u"Port"_s,          u"UseSSL"_s, u"User"_s};
    EXPECT_EQ(cameras.value(u"Plain"_s).toMap().keys(), recordKeys);
    EXPECT_EQ(cameras.value(u"Sparse"_s).toMap().keys(), recordKeys);
    struct Row
    {
        const char* camera;
        const char* key;
        QVariant expected; // invalid: the record has no such value
    };
    const std::vector<Row> rows{
        {"Plain", "Name", u"Plain"_s},
        {"Plain", "IP", u"127.0.0.1"_s},
        {"Plain", "Port", 8080}, // SSL off: HTTPSPort ignored
        {"Plain", "UseSSL", false},
        {"Plain", "User", u"admin"_s},
        {"Plain", "Password", u"736563726574"_s},
        {"Plain", "DelvixProtect", false},
        {"SslWithPort", "Port", 8443},
        {"SslWithPort", "UseSSL", true},
        {"SslWithPort", "DelvixProtect", true},
        {"SslNoPort", "Port", 443},
        {"SslNoPort", "DelvixProtect", false},
        {"Multi3", "MultiChannelID", 2},
        {"Multi0", "MultiChannelID", 0},
        {"MultiNoChannel", "MultiChannelID", 0},
        {"HostileChannel", "MultiChannelID", 0},
        {"SingleChannel", "MultiChannelID", {}},
        {"Plain", "MultiChannelID", {}},
        {"Dup", "Port", 2},
        {"Sparse", "IP", {}},
        {"Sparse", "User", {}},
        {"Sparse", "Password", {}},
        {"Sparse", "Port", 0},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(std::string(row.camera) + "." + row.key);
        EXPECT_EQ(cameras.value(QLatin1String(row.camera)).toMap().value(QLatin1String(row.key)),
                  row.expected);
    }
}

TEST_F(TunnelControlTest, SingleCamAndHostileShapesAreHandled)
{
    const QVariantMap single = camerasOf(readData("nodeinfo_single.xml"));
    ASSERT_EQ(single.keys(), QStringList{u"Only"_s});
    EXPECT_EQ(single.value(u"Only"_s).toMap().value(u"Port"_s).toInt(), 18081);

    // Elements where texts are expected, texts where elements are expected: no foreign trees in
    // records, no crash.
    const QVariantMap odd = camerasOf(QStringLiteral(
        "<NodeInfo><Cameras><Cam><Name>N</Name><IP><Deep>x</Deep></IP><User>a</User><User>b</User>"
        "<ObjectMetaRecordCap>true</ObjectMetaRecordCap></Cam><Cam>text</Cam></Cameras></NodeInfo>"));
    ASSERT_EQ(odd.keys(), QStringList{u"N"_s});
    EXPECT_EQ(odd.value(u"N"_s).toMap().value(u"IP"_s).typeId(), QMetaType::QString);
    EXPECT_EQ(odd.value(u"N"_s).toMap().value(u"User"_s).typeId(), QMetaType::QString);
    EXPECT_TRUE(camerasOf(u"<NodeInfo>flat</NodeInfo>"_s).isEmpty());
    EXPECT_TRUE(camerasOf(u"<Other><Cameras>"_s + camXml(u"x"_s) + u"</Cameras></Other>"_s).isEmpty());
}

TEST_F(TunnelControlTest, AnswerFailureRuleAppliesToEveryCallback)
{
    QSignalSpy cameras(control.get(), &NOVIRSrvTunnelControl::updateCameras);
    QSignalSpy camera(control.get(), &NOVIRSrvTunnelControl::updateCamera);
    QSignalSpy locations(control.get(), &NOVIRSrvTunnelControl::updateLocations);
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    const int all = client.lastRequest(kGetNodeInfo);
    client.answer(all, false, u"-1"_s, nodeInfo({camXml(u"A"_s)}));
    EXPECT_EQ(cameras.count(), 0);
    client.answer(all, false, u"0"_s, nodeInfo({camXml(u"A"_s)}));
    ASSERT_EQ(cameras.count(), 1);
    EXPECT_TRUE(cameras.last().at(0).toMap().contains(u"A"_s));

    const int locs = client.lastRequest(kQryLocs);
    client.answer(locs, false, u"-1"_s, locRecs(u"true"_s, {locXml(u"A"_s, u"Loc1"_s)}));
    EXPECT_EQ(locations.count(), 0); // a failed last part is dropped, finish flag and all
    client.answer(locs, false, u"0"_s, locRecs(u"true"_s, {locXml(u"A"_s, u"Loc1"_s)}));
    ASSERT_EQ(locations.count(), 1);
    EXPECT_TRUE(locations.last().at(0).toMap().contains(u"A"_s));

    client.broadcast(u"CamIns"_s, QString(), u"<CamIns><Entry><Name>B</Name></Entry></CamIns>"_s);
    const int one = client.lastRequest(kGetNodeInfo);
    ASSERT_NE(one, all);
    client.answer(one, false, u"-2"_s, nodeInfo({camXml(u"B"_s)}));
    EXPECT_EQ(camera.count(), 0);
    client.answer(one, false, u"0"_s, nodeInfo({camXml(u"B"_s)}));
    EXPECT_EQ(camera.count(), 1);
}

TEST_F(TunnelControlTest, AllCamerasInPartsAnnounceEverythingReceivedSoFar)
{
    QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::updateCameras);
    client.connectServer(ConfigServer);
    const int all = client.lastRequest(kGetNodeInfo);
    client.answer(all, true, u"0"_s, nodeInfo({camXml(u"A"_s), camXml(u"B"_s)}), false);
    client.answer(all, true, u"0"_s, u"<NodeInfo><Cameras>"_s,
                  false); // unparseable
    client.answer(all, true, u"0"_s, nodeInfo({camXml(u"C"_s), camXml(u"B"_s, 99)}), true);
    ASSERT_EQ(spy.count(), 3);
    EXPECT_EQ(spy.at(0).at(0).toMap().keys(), (QStringList{u"A"_s, u"B"_s}));
    EXPECT_EQ(spy.at(1).at(0).toMap().keys(), (QStringList{u"A"_s, u"B"_s}));
    const QVariantMap last = spy.at(2).at(0).toMap();
    EXPECT_EQ(last.keys(), (QStringList{u"A"_s, u"B"_s, u"C"_s}));
    EXPECT_EQ(last.value(u"B"_s).toMap().value(u"Port"_s).toInt(), 99);

    // A second answer starts from nothing; an unconvertible first part announces an empty map.
    client.connectServer(ConfigServer);
    client.answer(client.lastRequest(kGetNodeInfo), true, u"0"_s, u"not xml"_s);
    ASSERT_EQ(spy.count(), 4);
    EXPECT_TRUE(spy.at(3).at(0).toMap().isEmpty());
}

TEST_F(TunnelControlTest, LocationPartsMergeLaterPartWinsOneAnnouncementAtFinish)
{
    QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::updateLocations);
    client.connectServer(LocationServer);
    const int locs = client.lastRequest(kQryLocs);
    client.answer(locs, true, u"0"_s,
                  locRecs(u"true"_s, {locXml(u"A"_s, u"Loc1"_s), locXml(u"B"_s, u"Loc2"_s)}), false);
    client.answer(locs, true, u"0"_s, u"<LocRecs>"_s, false);
    client.answer(locs, true, u"0"_s, locRecs(u"false"_s, {locXml(u"B"_s, u"Loc7"_s, 5)}), false);
    EXPECT_EQ(spy.count(), 0);
    client.answer(locs, true, u"0"_s, locRecs(u"true"_s, {locXml(u"C"_s, u"Loc3"_s)}), true);
    ASSERT_EQ(spy.count(), 1);
    const QVariantMap map = spy.at(0).at(0).toMap();
    EXPECT_EQ(map.keys(), (QStringList{u"A"_s, u"B"_s, u"C"_s}));
    const QVariantMap b = map.value(u"B"_s).toMap();
    EXPECT_EQ(b.value(u"Location"_s).toString(), u"Loc7"_s);
    EXPECT_EQ(b.value(u"GroupID"_s).toInt(), 5);
    EXPECT_EQ(b.value(u"IsRecording"_s).toString(), u"false"_s);

    // A second location connection clears what was collected before asking again.
    client.connectServer(LocationServer);
    client.answer(client.lastRequest(kQryLocs), true, u"0"_s,
                  locRecs(u"true"_s, {locXml(u"D"_s, u"Loc4"_s)}));
    ASSERT_EQ(spy.count(), 2);
    EXPECT_EQ(spy.at(1).at(0).toMap().keys(), QStringList{u"D"_s});

    // An unconvertible finished part adds nothing but still announces.
    client.connectServer(LocationServer);
    client.answer(client.lastRequest(kQryLocs), true, u"0"_s, u"<broken"_s);
    ASSERT_EQ(spy.count(), 3);
    EXPECT_TRUE(spy.at(2).at(0).toMap().isEmpty());
}

TEST_F(TunnelControlTest, LocationParserLiveAliasAndRecordShape)
{
    const QVariantMap map = locationsOf(readData("locations_two_lists.xml"));
    EXPECT_EQ(map.keys(), (QStringList{QString(), u"CamA"_s, u"CamB"_s, u"CamC"_s, u"Repeated"_s}));
    const QVariantMap a = map.value(u"CamA"_s).toMap();
    EXPECT_EQ(a.keys(), (QStringList{u"GroupID"_s, u"IsRecording"_s, u"Location"_s}));
    EXPECT_EQ(a.value(u"Location"_s).toString(), u"Loc1"_s);
    EXPECT_EQ(a.value(u"IsRecording"_s).toString(), u"true"_s);
    EXPECT_TRUE(a.value(u"IsRecording"_s).toBool());
    EXPECT_EQ(map.value(u"CamC"_s).toMap().value(u"IsRecording"_s).toString(), u"false"_s);
    EXPECT_FALSE(map.value(u"CamC"_s).toMap().value(u"IsRecording"_s).toBool());
    EXPECT_EQ(map.value(QString()).toMap().value(u"Location"_s).toString(), u"Loc4"_s);
    EXPECT_EQ(map.value(u"Repeated"_s).toMap().value(u"Location"_s).toString(), u"Loc9"_s);
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

    client.broadcast(u"CamIns"_s, QString(),
                     u"<CamIns><Entry><Name>New &amp; &lt;Cam&gt;</Name></Entry></CamIns>"_s);
    ASSERT_EQ(client.requests.size(), before + 1);
    EXPECT_EQ(client.requests.last().cmdName, kGetNodeInfo);
    EXPECT_EQ(client.requests.last().info.strContent,
              u"<GetNodeInfo><Node>New &amp; &lt;Cam&gt;</Node></GetNodeInfo>"_s);
    client.answer(client.requests.size() - 1, true, u"0"_s, nodeInfo({camXml(u"X"_s), camXml(u"W"_s)}));
    ASSERT_EQ(camera.count(), 2);
    EXPECT_EQ(camera.at(0).at(0).toString(), u"W"_s); // key order
    EXPECT_EQ(camera.at(1).at(0).toString(), u"X"_s);
    EXPECT_EQ(camera.at(1).at(1).toMap().value(u"Name"_s).toString(), u"X"_s);
    EXPECT_EQ(cameras.count(), 0);

    client.broadcast(u"CamInfoChange"_s, QString(), u"<CamInfoChange><Cam>Lobby</Cam></CamInfoChange>"_s);
    EXPECT_EQ(client.requests.last().info.strContent, u"<GetNodeInfo><Node>Lobby</Node></GetNodeInfo>"_s);
    // An answer to another command through the same callback is ignored.
    client.requests.last().info.respCB(true, kSubCamStatus, QString(), u"0"_s, nodeInfo({camXml(u"Z"_s)}),
                                       true);
    EXPECT_EQ(camera.count(), 2);

    client.broadcast(u"CamRmv"_s, QString(), u"<CamRm><Name>Gone</Name></CamRm>"_s);
    ASSERT_EQ(removed.count(), 1);
    EXPECT_EQ(removed.at(0).at(0).toString(), u"Gone"_s);

    client.broadcast(u"ChannelAdd"_s, QString(),
                     u"<ChannelAdd><CamName>Lobby</CamName><Loc>Loc12</Loc><GrpID>3</GrpID></ChannelAdd>"_s);
    ASSERT_EQ(added.count(), 1);
    EXPECT_EQ(added.at(0).at(0).toString(), u"Lobby"_s);
    const QVariantMap location = added.at(0).at(1).toMap();
    EXPECT_EQ(location.value(u"Location"_s), QVariant(u"Loc12"_s));
    EXPECT_EQ(location.value(u"GroupID"_s).typeId(), QMetaType::Int);
    EXPECT_EQ(location.value(u"GroupID"_s).toInt(), 3);
    EXPECT_EQ(location.value(u"IsRecording"_s), QVariant(true));

    client.broadcast(u"ChannelRmv"_s, QString(), u"<ChannelRmv><CamName>Lobby</CamName></ChannelRmv>"_s);
    ASSERT_EQ(locationRemoved.count(), 1);
    EXPECT_EQ(locationRemoved.at(0).at(0).toString(), u"Lobby"_s);

    // Relayed, malformed and unknown broadcasts change nothing.
    const int requests = client.requests.size();
    client.broadcast(u"CamRmv"_s, u"relay/1"_s, u"<CamRm><Name>Gone</Name></CamRm>"_s);
    client.broadcast(u"CamIns"_s, u"relay/1"_s, u"<CamIns><Entry><Name>R</Name></Entry></CamIns>"_s);
    client.broadcast(u"ChannelRmv"_s, QString(), u"<ChannelRmv><CamName>"_s);
    client.broadcast(u"CamIns"_s, QString(), u"<CamIns"_s);
    EXPECT_EQ(removed.count(), 1);
    EXPECT_EQ(locationRemoved.count(), 1);
    EXPECT_EQ(client.requests.size(), requests);
}

TEST_F(TunnelControlTest, CameraStatusEventsFromTheServerOnly)
{
    QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::updateCameraStatus);
    client.connectServer(ConfigServer);
    client.statusEvent(
        u"srv-1"_s, QString(),
        QStringLiteral("<CamStatus><Cam><Name>A</Name><ConnState>Connected</ConnState></Cam>"
                       "<Cam><Name>B</Name><ConnState>Disconnected</ConnState></Cam>"
                       "<Cam><Name>C</Name><ConnState>connected</ConnState></Cam></CamStatus>"));
    ASSERT_EQ(spy.count(), 3);
    EXPECT_EQ(spy.at(0).at(0).toString(), u"A"_s);
    EXPECT_TRUE(spy.at(0).at(1).toBool());
    EXPECT_FALSE(spy.at(1).at(1).toBool());
    EXPECT_FALSE(spy.at(2).at(1).toBool()); // exact text only
    client.statusEvent(u"srv-1"_s, QString(),
                       u"<CamStatus><Cam><Name>D</Name><ConnState>Connected</ConnState></Cam></CamStatus>"_s);
    ASSERT_EQ(spy.count(), 4);
    EXPECT_EQ(spy.at(3).at(0).toString(), u"D"_s);

    const QString event =
        u"<CamStatus><Cam><Name>E</Name><ConnState>Connected</ConnState></Cam></CamStatus>"_s;
    client.statusEvent(u"other"_s, QString(), event);
    client.statusEvent(u"srv-1"_s, u"relay/2"_s, event);
    client.statusEvent(u"srv-1"_s, QString(), QString());
    client.statusEvent(u"srv-1"_s, QString(), u"<CamStatus><Cam>"_s);
    EXPECT_EQ(spy.count(), 4);
}

TEST_F(TunnelControlTest, SendRequestRelaysEveryPartAndEventsAreForwarded)
{
    QSignalSpy spy(control.get(), &NOVIRSrvTunnelControl::reqResp);
    int context = 0;
    ASSERT_TRUE(
        control->sendRequest(&client.account, u"Custom"_s, u"<C/>"_s, u"extra"_s, &context, ConfigServer));
    const auto& request = client.requests.last();
    EXPECT_EQ(request.cmdName, u"Custom"_s);
    EXPECT_EQ(request.info.strExtra, u"extra"_s);
    EXPECT_EQ(request.info.strContent, u"<C/>"_s);
    request.info.respCB(false, u"Custom"_s, u"r/1"_s, u"-1"_s, u"no"_s, false);
    request.info.respCB(true, u"Custom"_s, QString(), u"0"_s, u"yes"_s, true);
    ASSERT_EQ(spy.count(), 2);
    EXPECT_FALSE(spy.at(0).at(0).toBool());
    EXPECT_FALSE(spy.at(0).at(1).toBool());
    EXPECT_EQ(spy.at(0).at(2).toString(), u"no"_s);
    EXPECT_EQ(spy.at(0).at(3).toString(), u"r/1"_s);
    EXPECT_EQ(spy.at(0).at(4).value<void*>(), &context);
    EXPECT_EQ(spy.at(0).at(5).toString(), u"-1"_s);
    EXPECT_TRUE(spy.at(1).at(1).toBool());

    control->hdlrReqResp(true, u"X"_s, u"p"_s, u"0"_s, u"t"_s, true, nullptr, &context);
    ASSERT_EQ(spy.count(), 3);
    EXPECT_EQ(spy.at(2).at(4).value<void*>(), &context);

    client.accept = false;
    EXPECT_FALSE(
        control->sendRequest(&client.account, u"Custom"_s, QString(), QString(), nullptr, ConfigServer));

    QSignalSpy events(control.get(), &NOVIRSrvTunnelControl::evtResp);
    ASSERT_TRUE(control->registerEventHandler(&client.account, u"Evt"_s, ConfigServer));
    ASSERT_EQ(client.eventRegistrations.size(), 1);
    EXPECT_EQ(client.eventRegistrations.first().name, u"Evt"_s);
    client.eventHandlers.first()(client.handleOf(ConfigServer), u"src"_s, u"Evt"_s, ConfigServer, u"relay"_s,
                                 u"<M/>"_s);
    ASSERT_EQ(events.count(), 1);
    EXPECT_EQ(events.at(0).at(1).toString(), u"relay"_s);
    EXPECT_EQ(events.at(0).at(2).toString(), u"<M/>"_s);
}

TEST_F(TunnelControlTest, LateCallbacksAfterDestructionFindTheGuard)
{
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    int context = 0;
    control->sendRequest(&client.account, u"Custom"_s, QString(), QString(), &context, ConfigServer);
    control.reset();
    // Every handler and callback the client still holds now meets a revoked guard.
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    for (int i = 0; i < client.requests.size(); ++i) {
        client.answer(i, true, u"0"_s, nodeInfo({camXml(u"A"_s)}));
    }
    client.broadcast(u"CamIns"_s, QString(), u"<CamIns><Entry><Name>B</Name></Entry></CamIns>"_s);
    client.statusEvent(u"srv-1"_s, QString(), u"<CamStatus/>"_s);
    EXPECT_EQ(client.countRequests(kGetNodeInfo), 1); // nothing was sent on behalf of the dead control
    EXPECT_EQ(client.countRequests(kQryLocs), 1);
}
