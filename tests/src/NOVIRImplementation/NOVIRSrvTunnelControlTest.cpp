// The tunnel control against a client the test scripts: what it registers and sends, how it turns
// answers (through its two parsers), broadcasts and events into signals.
#include "NOVIRImplementation/NOVIRSrvTunnelControl.h"
#include "ScriptedTunnelClient.h"

#include <QFile>
#include <QJsonDocument>
#include <QJsonObject>
#include <gtest/gtest.h>
#include <memory>

using namespace Qt::StringLiterals;

namespace {

using NSNovirTunnelClient::ConfigServer;
using NSNovirTunnelClient::LocationServer;

QString readData(const char* name)
{
    QFile file(QStringLiteral(NOVIR_TEST_DATA "/") + QLatin1String(name));
    EXPECT_TRUE(file.open(QIODevice::ReadOnly)) << name;
    return QString::fromUtf8(file.readAll());
}

QString camXml(const QString& name, int port = 80)
{
    return u"<Cam><Name>%1</Name><Port>%2</Port><ObjectMetaRecordCap>true</ObjectMetaRecordCap></Cam>"_s
        .arg(name)
        .arg(port);
}

QString nodeInfo(const QStringList& cams)
{
    return u"<NodeInfo><Cameras>"_s + cams.join(QString()) + u"</Cameras></NodeInfo>"_s;
}

QString locRecs(const QString& live, const QString& locs)
{
    return u"<LocRecs><LocList><Live>%1</Live>%2</LocList></LocRecs>"_s.arg(live, locs);
}

QString locXml(const QString& alias, const QString& location, int group = 1)
{
    return u"<Loc><Alias>%1</Alias><Name>%2</Name><GrpID>%3</GrpID></Loc>"_s.arg(alias, location).arg(group);
}

QString json(const QVariantMap& map)
{
    return QString::fromUtf8(QJsonDocument(QJsonObject::fromVariantMap(map)).toJson(QJsonDocument::Compact));
}

class TunnelControlTest : public ::testing::Test
{
protected:
    // Everything the control emits or sends, in order, as text.
    void SetUp() override
    {
        control = std::make_unique<NOVIRSrvTunnelControl>(&client);
        auto* c = control.get();
        auto log = [this](const QString& line) { events << line; };
        QObject::connect(c, &NOVIRSrvTunnelControl::updateCameras, c,
                         [=](const QVariantMap& map) { log(u"cameras "_s + map.keys().join(u',')); });
        QObject::connect(c, &NOVIRSrvTunnelControl::updateLocations, c,
                         [=](const QVariantMap& map) { log(u"locations "_s + map.keys().join(u',')); });
        QObject::connect(c, &NOVIRSrvTunnelControl::updateCamera, c,
                         [=](const QString& name, const QVariantMap&) { log(u"camera "_s + name); });
        QObject::connect(c, &NOVIRSrvTunnelControl::removeCamera, c,
                         [=](const QString& name) { log(u"removed "_s + name); });
        QObject::connect(c, &NOVIRSrvTunnelControl::addLocation, c,
                         [=](const QString& name, const QVariantMap& map) {
                             log(u"located "_s + name + u' ' + json(map));
                         });
        QObject::connect(c, &NOVIRSrvTunnelControl::removeLocation, c,
                         [=](const QString& name) { log(u"unlocated "_s + name); });
        QObject::connect(c, &NOVIRSrvTunnelControl::updateCameraStatus, c, [=](const QString& name, bool on) {
            log(u"status "_s + name + (on ? u" on"_s : u" off"_s));
        });
        client.onInsert = [this](int i) {
            events << u"sent "_s + client.requests.at(i).cmdName + u' ' +
                          client.requests.at(i).info.strContent;
        };
    }
    // The map announced for one answer on a new connection ("(none)" when nothing was announced).
    template <typename Signal>
    QVariantMap announced(Signal signal, NSNovirTunnelClient::ServerType server, const QString& answer)
    {
        QVariantMap result{{u"(none)"_s, 0}};
        auto connection = QObject::connect(control.get(), signal, control.get(),
                                           [&](const QVariantMap& map) { result = map; });
        client.connectServer(server);
        client.answer(client.lastRequest(server == ConfigServer ? u"GetNodeInfo"_s : u"QryLocs"_s), true,
                      u"0"_s, answer);
        QObject::disconnect(connection);
        return result;
    }
    QVariantMap lastCameras(const QString& answer)
    {
        return announced(&NOVIRSrvTunnelControl::updateCameras, ConfigServer, answer);
    }
    QVariantMap lastLocations(const QString& answer)
    {
        return announced(&NOVIRSrvTunnelControl::updateLocations, LocationServer, answer);
    }
    QStringList take() { return std::exchange(events, {}); }

    ScriptedTunnelClient client; // outlives the control, as the host's client does
    std::unique_ptr<NOVIRSrvTunnelControl> control;
    QStringList events;
};

} // namespace

TEST_F(TunnelControlTest, EachConnectionStartsItsWork)
{
    client.connectServer(ConfigServer, false);
    client.connectServer(LocationServer, false);
    client.connectServer(static_cast<NSNovirTunnelClient::ServerType>(2));
    EXPECT_TRUE(take().isEmpty());

    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    EXPECT_EQ(client.broadcastRegistrations.size(), 5);
    EXPECT_EQ(take(), (QStringList{u"sent GetNodeInfo <GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>"_s,
                                   u"sent SubCamStatus <SubCamStatus><SID>srv-1</SID></SubCamStatus>"_s,
                                   u"sent QryLocs <QryLocs><LiveOnly>false</LiveOnly></QryLocs>"_s}));
    EXPECT_EQ(client.requests.at(1).serverId, u"srv-1"_s);
    EXPECT_EQ(client.requests.at(2).type, LocationServer);

    // A new connection repeats the steps; the server id is escaped in the text, passed on as it is.
    client.serverId = u"a<b>&c"_s;
    client.connectServer(ConfigServer);
    EXPECT_EQ(take().last(), u"sent SubCamStatus <SubCamStatus><SID>a&lt;b&gt;&amp;c</SID></SubCamStatus>"_s);
    EXPECT_EQ(client.requests.last().serverId, u"a<b>&c"_s);
}

TEST_F(TunnelControlTest, ParsersKeepRecordingCamerasWithTheirConnectionRulesAndEveryLocationList)
{
    // The records' values for the "camera.key" of each "camera.key=value" in expected ('-': none).
    auto valuesFor = [](const QVariantMap& records, const QString& expected) {
        QStringList result;
        for (const QString& field : expected.split(u' ')) {
            const QString name = field.section(u'=', 0, 0);
            const QVariant value =
                records.value(name.section(u'.', 0, 0)).toMap().value(name.section(u'.', 1));
            result << name + u'=' + (value.isValid() ? value.toString() : u"-"_s);
        }
        return result.join(u' ');
    };
    const QVariantMap cameras = lastCameras(readData("nodeinfo_edge_cases.xml"));
    EXPECT_EQ(
        cameras.keys().join(u' '),
        u"Dup HostileChannel Multi0 Multi3 MultiNoChannel Plain SingleChannel Sparse SslNoPort SslWithPort"_s);
    // SSL off: HTTPSPort ignored; the password stays hexadecimal; a later duplicate wins; a channel
    // number counts from 1 and never goes below 0.
    const QString expected =
        u"Plain.IP=127.0.0.1 Plain.Port=8080 Plain.UseSSL=false Plain.User=admin Plain.Password=736563726574 "
        "Plain.DelvixProtect=false Plain.MultiChannelID=- SslWithPort.Port=8443 SslWithPort.UseSSL=true "
        "SslWithPort.DelvixProtect=true SslNoPort.Port=443 SslNoPort.DelvixProtect=false "
        "Multi3.MultiChannelID=2 "
        "Multi0.MultiChannelID=0 MultiNoChannel.MultiChannelID=0 HostileChannel.MultiChannelID=0 "
        "SingleChannel.MultiChannelID=- Dup.Port=2 Sparse.IP=- Sparse.Password=- Sparse.Port=0"_s;
    EXPECT_EQ(valuesFor(cameras, expected), expected);
    EXPECT_EQ(cameras.value(u"Plain"_s).toMap().size(), 7);
    EXPECT_EQ(lastCameras(nodeInfo({camXml(u"Only"_s, 18081)})).value(u"Only"_s).toMap().value(u"Port"_s),
              18081);

    const QVariantMap locations = lastLocations(readData("locations_two_lists.xml"));
    EXPECT_EQ(locations.keys(), (QStringList{QString(), u"CamA"_s, u"CamB"_s, u"CamC"_s, u"Repeated"_s}));
    const QString located = u"CamA.Location=Loc1 CamA.GroupID=1 CamA.IsRecording=true CamC.IsRecording=false "
                            ".Location=Loc4 Repeated.Location=Loc9"_s;
    EXPECT_EQ(valuesFor(locations, located), located);
}

TEST_F(TunnelControlTest, AnswersInPartsAndFailedAnswers)
{
    QVariantMap located;
    QObject::connect(control.get(), &NOVIRSrvTunnelControl::updateLocations, control.get(),
                     [&](const QVariantMap& map) { located = map; });
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    const int all = client.lastRequest(u"GetNodeInfo"_s);
    const int locs = client.lastRequest(u"QryLocs"_s);
    take();
    // A part fails when both the flag and the return code say so. Every camera part announces all received so
    // far; locations are announced once, at the finish, a later part winning; a failed last part is
    // dropped, finish and all; unparseable parts add nothing.
    client.answer(all, false, u"-1"_s, nodeInfo({camXml(u"A"_s)}));
    client.answer(all, false, u"0"_s, nodeInfo({camXml(u"A"_s), camXml(u"B"_s)}), false);
    client.answer(all, true, u"0"_s, u"<NodeInfo><Cameras>"_s, false);
    client.answer(all, true, u"0"_s, nodeInfo({camXml(u"C"_s), camXml(u"B"_s, 99)}));
    client.answer(locs, false, u"-1"_s, locRecs(u"true"_s, locXml(u"X"_s, u"Loc0"_s)));
    client.answer(locs, false, u"0"_s,
                  locRecs(u"true"_s, locXml(u"A"_s, u"Loc1"_s) + locXml(u"B"_s, u"Loc2"_s)), false);
    client.answer(locs, true, u"0"_s, u"<LocRecs>"_s, false);
    client.answer(locs, true, u"0"_s, locRecs(u"false"_s, locXml(u"B"_s, u"Loc7"_s, 5)), false);
    client.answer(locs, true, u"0"_s, locRecs(u"true"_s, locXml(u"C"_s, u"Loc3"_s)));
    EXPECT_EQ(take(),
              (QStringList{u"cameras A,B"_s, u"cameras A,B"_s, u"cameras A,B,C"_s, u"locations A,B,C"_s}));
    EXPECT_EQ(located.value(u"B"_s),
              QVariant(QVariantMap{
                  {u"GroupID"_s, u"5"_s}, {u"IsRecording"_s, u"false"_s}, {u"Location"_s, u"Loc7"_s}}));

    // One camera asked for after a broadcast: each camera of the answer, in key order; answers
    // that failed or belong to another command are ignored.
    client.broadcast(u"CamIns"_s, QString(), u"<CamIns><Entry><Name>B</Name></Entry></CamIns>"_s);
    const auto one = client.requests.last();
    one.info.respCB(false, u"GetNodeInfo"_s, QString(), u"-2"_s, nodeInfo({camXml(u"B"_s)}), true);
    one.info.respCB(true, u"SubCamStatus"_s, QString(), u"0"_s, nodeInfo({camXml(u"Z"_s)}), true);
    one.info.respCB(false, u"GetNodeInfo"_s, QString(), u"0"_s, nodeInfo({camXml(u"X"_s), camXml(u"W"_s)}),
                    true);
    EXPECT_EQ(take().mid(1), (QStringList{u"camera W"_s, u"camera X"_s}));

    // A new connection starts afresh; an unconvertible answer still announces, empty.
    EXPECT_EQ(lastLocations(locRecs(u"true"_s, locXml(u"D"_s, u"Loc4"_s))).keys(), QStringList{u"D"_s});
    EXPECT_TRUE(lastLocations(u"<broken"_s).isEmpty());
    EXPECT_EQ(lastCameras(nodeInfo({camXml(u"E"_s)})).keys(), QStringList{u"E"_s});
    EXPECT_TRUE(lastCameras(u"not xml"_s).isEmpty());
}

TEST_F(TunnelControlTest, BroadcastsAndStatusEvents)
{
    client.connectServer(ConfigServer);
    take();
    struct Row
    {
        const char* name; // a broadcast, or "status:<source>" for a camera status event
        const char* relay;
        const char* message;
        QStringList expected;
    };
    const QString two = u"<CamStatus><Cam><Name>A</Name><ConnState>Connected</ConnState></Cam>"
                        "<Cam><Name>B</Name><ConnState>connected</ConnState></Cam></CamStatus>"_s;
    const char* one = "<CamStatus><Cam><Name>E</Name><ConnState>Connected</ConnState></Cam></CamStatus>";
    const std::vector<Row> rows{
        {"CamIns",
         "",
         "<CamIns><Entry><Name>New &amp; &lt;Cam&gt;</Name></Entry></CamIns>",
         {u"sent GetNodeInfo <GetNodeInfo><Node>New &amp; &lt;Cam&gt;</Node></GetNodeInfo>"_s}},
        {"CamInfoChange",
         "",
         "<CamInfoChange><Cam>Lobby</Cam></CamInfoChange>",
         {u"sent GetNodeInfo <GetNodeInfo><Node>Lobby</Node></GetNodeInfo>"_s}},
        {"CamRmv", "", "<CamRm><Name>Gone</Name></CamRm>", {u"removed Gone"_s}},
        {"ChannelAdd",
         "",
         "<ChannelAdd><CamName>Lobby</CamName><Loc>Loc12</Loc><GrpID>3</GrpID></ChannelAdd>",
         {uR"(located Lobby {"GroupID":3,"IsRecording":true,"Location":"Loc12"})"_s}},
        {"ChannelRmv", "", "<ChannelRmv><CamName>Lobby</CamName></ChannelRmv>", {u"unlocated Lobby"_s}},
        {"CamRmv", "relay/1", "<CamRm><Name>Gone</Name></CamRm>", {}},
        {"CamIns", "relay/1", "<CamIns><Entry><Name>R</Name></Entry></CamIns>", {}},
        {"ChannelRmv", "", "<ChannelRmv><CamName>", {}},
        {"CamIns", "", "<CamIns", {}},
        {"status:srv-1", "", qPrintable(two), {u"status A on"_s, u"status B off"_s}}, // exact text only
        {"status:srv-1", "", one, {u"status E on"_s}},
        {"status:other", "", one, {}},
        {"status:srv-1", "relay/2", one, {}},
        {"status:srv-1", "", "", {}},
        {"status:srv-1", "", "<CamStatus><Cam>", {}},
    };
    for (const Row& row : rows) {
        const QString name = QString::fromUtf8(row.name);
        const QString relay = QString::fromUtf8(row.relay);
        if (name.startsWith(u"status:"_s)) {
            client.statusEvent(name.mid(7), relay, QString::fromUtf8(row.message));
        } else {
            client.broadcast(name, relay, QString::fromUtf8(row.message));
        }
        EXPECT_EQ(take(), row.expected) << row.name << " " << row.message;
    }
}

TEST_F(TunnelControlTest, LateCallbacksAfterDestructionFindTheGuard)
{
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    int context = 0;
    control->sendRequest(&client.account, u"Custom"_s, QString(), QString(), &context, ConfigServer);
    control.reset();
    take();
    // Every handler and callback the client still holds now meets a revoked guard.
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    for (int i = 0; i < client.requests.size(); ++i) {
        client.answer(i, true, u"0"_s, nodeInfo({camXml(u"A"_s)}));
    }
    client.broadcast(u"CamIns"_s, QString(), u"<CamIns><Entry><Name>B</Name></Entry></CamIns>"_s);
    client.statusEvent(u"srv-1"_s, QString(), u"<CamStatus/>"_s);
    EXPECT_TRUE(events.isEmpty()); // nothing sent on behalf of the dead control
}
