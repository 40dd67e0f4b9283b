// The tunnel control against a client the test scripts: what it sends, how it turns answers,
// broadcasts and events into signals.
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
using C = NOVIRSrvTunnelControl;

QString readData(const char* name)
{
    QFile file(QStringLiteral(NOVIR_TEST_DATA "/") + QLatin1String(name));
    EXPECT_TRUE(file.open(QIODevice::ReadOnly)) << name;
    return QString::fromUtf8(file.readAll());
}

class TunnelControlTest : public ::testing::Test
{
protected:
    // Everything the control emits or sends, in order, as "<name> <argument>...".
    void SetUp() override
    {
        control = std::make_unique<NOVIRSrvTunnelControl>(&client);
        record(&C::updateCameras, u"cameras"_s);
        record(&C::updateLocations, u"locs"_s);
        record(&C::updateCamera, u"cam"_s);
        record(&C::removeCamera, u"removed"_s);
        record(&C::addLocation, u"located"_s);
        record(&C::removeLocation, u"unlocated"_s);
        record(&C::updateCameraStatus, u"status"_s);
        client.onInsert = [this](int i) {
            events << u"sent "_s + client.requests.at(i).cmdName + u' ' +
                          client.requests.at(i).info.strContent;
        };
    }
    static QString text(const QString& s) { return s; }
    static QString text(bool on) { return on ? u"on"_s : u"off"_s; }
    static QString text(const QVariantMap& map) { return jsonText(map); }
    template <typename... A>
    void record(void (C::*signal)(A...), const QString& name)
    {
        QObject::connect(control.get(), signal, control.get(),
                         [=](std::decay_t<A>... args) { events << (name + ... + (u' ' + text(args))); });
    }
    // The map of the update signal after connecting `server` and answering its first request.
    QVariantMap announced(NSNovirTunnelClient::ServerType server, const QString& answer)
    {
        client.connectServer(server);
        client.answer(client.lastRequest(server == ConfigServer ? u"GetNodeInfo"_s : u"QryLocs"_s), true,
                      u"0"_s, answer);
        return QJsonDocument::fromJson(take().last().section(u' ', 1).toUtf8()).object().toVariantMap();
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
    client.connectServer(static_cast<NSNovirTunnelClient::ServerType>(2));
    EXPECT_TRUE(take().isEmpty());
    // A new connection repeats the steps; the server id is escaped in the text, passed on as it is.
    client.connectServer(ConfigServer);
    client.serverId = u"a<b>&c"_s;
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    EXPECT_EQ(take(),
              (QStringList{u"sent GetNodeInfo <GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>"_s,
                           u"sent SubCamStatus <SubCamStatus><SID>srv-1</SID></SubCamStatus>"_s,
                           u"sent GetNodeInfo <GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>"_s,
                           u"sent SubCamStatus <SubCamStatus><SID>a&lt;b&gt;&amp;c</SID></SubCamStatus>"_s,
                           u"sent QryLocs <QryLocs><LiveOnly>false</LiveOnly></QryLocs>"_s}));
    EXPECT_EQ(client.requests.at(3).serverId, u"a<b>&c"_s);
    EXPECT_EQ(client.requests.at(4).type, LocationServer);
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
            result << name + u'=' + (value.isNull() ? u"-"_s : value.toString());
        }
        return result.join(u' ').toStdString();
    };
    const QVariantMap cameras = announced(ConfigServer, readData("nodeinfo_edge_cases.xml"));
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
    EXPECT_EQ(valuesFor(cameras, expected), expected.toStdString());
    EXPECT_EQ(cameras.value(u"Plain"_s).toMap().size(), 7);

    const QVariantMap locations = announced(LocationServer, readData("locations_two_lists.xml"));
    EXPECT_EQ(locations.keys(), (QStringList{QString(), u"CamA"_s, u"CamB"_s, u"CamC"_s, u"Repeated"_s}));
    const QString located = u"CamA.Location=Loc1 CamA.GroupID=1 CamA.IsRecording=true CamC.IsRecording=false "
                            ".Location=Loc4 Repeated.Location=Loc9"_s;
    EXPECT_EQ(valuesFor(locations, located), located.toStdString());
    EXPECT_TRUE(announced(LocationServer, u"<broken"_s).isEmpty()); // still announced, empty
}

TEST_F(TunnelControlTest, AnswersInPartsAndFailedAnswers)
{
    client.connectServer(ConfigServer);
    client.connectServer(LocationServer);
    const int all = client.lastRequest(u"GetNodeInfo"_s);
    const int locs = client.lastRequest(u"QryLocs"_s);
    take();
    // A part fails when both the flag and the return code say so. Every camera part announces all
    // received so far; locations are announced once, at the finish, a later part winning; a failed
    // last part is dropped, finish and all; unparseable parts add nothing.
    client.answer(all, false, u"-1"_s, nodeInfo({u"A"_s}));
    client.answer(all, false, u"0"_s, nodeInfo({u"A"_s, u"B"_s}), false);
    client.answer(all, true, u"0"_s, u"<NodeInfo><Cameras>"_s, false);
    client.answer(all, true, u"0"_s, nodeInfo({u"C"_s}));
    client.answer(locs, false, u"-1"_s, locRecs(u"X"_s, u"Loc0"_s));
    client.answer(locs, false, u"0"_s, locRecs(u"B"_s, u"Loc2"_s), false);
    client.answer(locs, true, u"0"_s, u"<LocRecs>"_s, false);
    client.answer(locs, true, u"0"_s, locRecs(u"B"_s, u"Loc7"_s, 5, u"false"_s));
    QStringList got;
    for (const QString& e : take()) {
        got << e.section(u' ', 0, 0) + u' ' +
                   QJsonDocument::fromJson(e.section(u' ', 1).toUtf8()).object().keys().join(u',');
    }
    EXPECT_EQ(got, (QStringList{u"cameras A,B"_s, u"cameras A,B"_s, u"cameras A,B,C"_s, u"locs B"_s}));

    // One camera asked for after a broadcast: each camera of the answer, in key order; answers
    // that failed or belong to another command are ignored.
    client.broadcast(u"CamIns"_s, QString(), u"<CamIns><Entry><Name>B</Name></Entry></CamIns>"_s);
    const auto one = client.requests.last();
    one.info.respCB(false, u"GetNodeInfo"_s, QString(), u"-2"_s, nodeInfo({u"B"_s}), true);
    one.info.respCB(true, u"SubCamStatus"_s, QString(), u"0"_s, nodeInfo({u"Z"_s}), true);
    one.info.respCB(false, u"GetNodeInfo"_s, QString(), u"0"_s, nodeInfo({u"X"_s, u"W"_s}), true);
    QStringList cams = take().mid(1);
    for (QString& cam : cams) {
        cam = cam.section(u' ', 0, 1);
    }
    EXPECT_EQ(cams, (QStringList{u"cam W"_s, u"cam X"_s}));
}

TEST_F(TunnelControlTest, BroadcastsAndStatusEvents)
{
    client.connectServer(ConfigServer);
    take();
    const QString two = u"<CamStatus><Cam><Name>A</Name><ConnState>Connected</ConnState></Cam>"
                        "<Cam><Name>B</Name><ConnState>connected</ConnState></Cam></CamStatus>"_s;
    const QString one = u"<CamStatus><Cam><Name>E</Name><ConnState>Connected</ConnState></Cam></CamStatus>"_s;
    // {broadcast name or "status:<source>", relay path, message, expected events}
    const std::vector<std::tuple<QString, QString, QString, QStringList>> rows{
        {u"CamIns"_s,
         {},
         u"<CamIns><Entry><Name>New &amp; &lt;Cam&gt;</Name></Entry></CamIns>"_s,
         {u"sent GetNodeInfo <GetNodeInfo><Node>New &amp; &lt;Cam&gt;</Node></GetNodeInfo>"_s}},
        {u"CamInfoChange"_s,
         {},
         u"<CamInfoChange><Cam>Lobby</Cam></CamInfoChange>"_s,
         {u"sent GetNodeInfo <GetNodeInfo><Node>Lobby</Node></GetNodeInfo>"_s}},
        {u"CamRmv"_s, {}, u"<CamRm><Name>Gone</Name></CamRm>"_s, {u"removed Gone"_s}},
        {u"ChannelAdd"_s,
         {},
         u"<ChannelAdd><CamName>Lobby</CamName><Loc>Loc12</Loc><GrpID>3</GrpID></ChannelAdd>"_s,
         {uR"(located Lobby {"GroupID":3,"IsRecording":true,"Location":"Loc12"})"_s}},
        {u"ChannelRmv"_s, {}, u"<ChannelRmv><CamName>Lobby</CamName></ChannelRmv>"_s, {u"unlocated Lobby"_s}},
        {u"CamRmv"_s, u"relay/1"_s, u"<CamRm><Name>Gone</Name></CamRm>"_s, {}},
        {u"ChannelRmv"_s, {}, u"<ChannelRmv><CamName>"_s, {}},
        {u"status:srv-1"_s, {}, two, {u"status A on"_s, u"status B off"_s}}, // exact text only
        {u"status:other"_s, {}, one, {}},
        {u"status:srv-1"_s, u"relay/2"_s, one, {}},
        {u"status:srv-1"_s, {}, u"<CamStatus><Cam>"_s, {}},
    };
    for (const auto& [name, relay, message, expected] : rows) {
        if (name.startsWith(u"status:"_s)) {
            client.statusEvent(name.mid(7), relay, message);
        } else {
            client.broadcast(name, relay, message);
        }
        EXPECT_EQ(take(), expected) << qPrintable(name + u' ' + message);
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
    for (int i = 0; i < client.requests.size(); ++i) {
        client.answer(i, true, u"0"_s, nodeInfo({u"A"_s}));
    }
    client.broadcast(u"CamIns"_s, QString(), u"<CamIns><Entry><Name>B</Name></Entry></CamIns>"_s);
    client.statusEvent(u"srv-1"_s, QString(), u"<CamStatus/>"_s);
    EXPECT_TRUE(events.isEmpty());
}
