// The camera directory. The tunnel control against a client the test scripts (what it sends, how
// it turns answers, broadcasts and events into signals); the collector over it (merge and rebuild
// rules, location lookup from other threads, the "InputObjectMetaInfo" text that writeData sends);
// and end to end with the configuration-server simulator on its own thread.
#include "CameraInformationCollector.h"
#include "HostFakes.h"
#include "NovirConfigServer.h"
#include "ScriptedTunnelClient.h"
#include "TestWait.h"

#include <QFile>
#include <QJsonDocument>
#include <QJsonObject>
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
        // The records of a "A=Loc1,B=Loc2" list: locations, or cameras when there is no '='.
        auto list = [](const QString& pairs) {
            QVariantMap map;
            for (const QString& pair : pairs.split(u',')) {
                map.insert(pair.section(u'=', 0, 0), pair.contains(u'=') ? location(pair.section(u'=', 1))
                                                                         : QVariantMap{{u"Port"_s, 80}});
            }
            return map;
        };
        using Step = std::function<void(const QStringList&)>;
        const QHash<QString, Step> steps{
            {u"cams"_s, [&](const QStringList& w) { emit control->updateCameras(list(w[1])); }},
            {u"locs"_s, [&](const QStringList& w) { emit control->updateLocations(list(w[1])); }},
            {u"loc"_s,
             [&](const QStringList& w) {
                 emit control->addLocation(w[1], location(w[2], w.value(3, u"1"_s).toInt()));
             }},
            {u"on"_s, [&](const QStringList& w) { emit control->updateCameraStatus(w[1], true); }},
            {u"off"_s, [&](const QStringList& w) { emit control->updateCameraStatus(w[1], false); }},
            {u"rmcam"_s, [&](const QStringList& w) { emit control->removeCamera(w[1]); }},
            {u"rmloc"_s, [&](const QStringList& w) { emit control->removeLocation(w[1]); }},
            {u"cam"_s, [&](const QStringList& w) {
                 QVariantMap record{{u"Name"_s, w[1]}, {u"Port"_s, w[2].toInt()}};
                 record.insert(w.size() > 4 ? location(w[3], w[4].toInt()) : QVariantMap());
                 emit control->updateCamera(w[1], record);
             }}};
        for (const QString& step : script.split(u';', Qt::SkipEmptyParts)) {
            const QStringList w = step.split(u' ', Qt::SkipEmptyParts);
            steps.value(w[0])(w);
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

using NSNovirTunnelClient::ConfigServer;
using NSNovirTunnelClient::LocationServer;
using C = NOVIRSrvTunnelControl;

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
    static QString text(const QVariantMap& map)
    {
        return QString::fromUtf8(
            QJsonDocument(QJsonObject::fromVariantMap(map)).toJson(QJsonDocument::Compact));
    }
    template <typename... A>
    void record(void (C::*signal)(A...), const QString& name)
    {
        QObject::connect(control.get(), signal, control.get(),
                         [=](std::decay_t<A>... args) { events << (name + ... + (u' ' + text(args))); });
    }
    // The map of the update signal after connecting `server` and answering its first request with
    // the data file `name`.
    QVariantMap announced(NSNovirTunnelClient::ServerType server, const char* name)
    {
        QFile file(QStringLiteral(NOVIR_TEST_DATA "/") + QLatin1String(name));
        EXPECT_TRUE(file.open(QIODevice::ReadOnly)) << name;
        client.connectServer(server);
        client.answer(client.lastRequest(server == ConfigServer ? u"GetNodeInfo"_s : u"QryLocs"_s), true,
                      u"0"_s, QString::fromUtf8(file.readAll()));
        return QJsonDocument::fromJson(take().last().section(u' ', 1).toUtf8()).object().toVariantMap();
    }
    QStringList take() { return std::exchange(events, {}); }

    ScriptedTunnelClient client; // outlives the control, as the host's client does
    std::unique_ptr<NOVIRSrvTunnelControl> control;
    QStringList events;
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
    // An empty settings map drops both.
    collector->setDelvixSettings(QVariantMap());
    collector->writeData(1, 1, body);
    EXPECT_EQ(sentInfo().count(u"Thumbnail\""_s), 0);

    // Markup is escaped, "%1" is data, non-ASCII text survives, characters XML does not allow go out
    // as their JSON escapes, and IDs are 64 bits wide.
    const QString rows[][2] = {
        {uR"({"ObjectMetaInfo":[{"ID":1, "P":"京A<b>&%1"}]})"_s,
         uR"({"ObjectMetaInfo":[{"ID":1,"P":"京A&lt;b&gt;&amp;%1"}]})"_s},
        // Markup alone: nothing else would make the text longer.
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
    auto camera = [](const QString& name, int port, const QString& location) {
        return NovirCamera{name, u"127.0.0.1"_s, port, false, 0,       u"admin"_s, u"pw-"_s + name,
                           true, false,          1,    1,     location};
    };
    // The same directory whether the server writes its XML compact or indented.
    for (const bool pretty : {false, true}) {
        SCOPED_TRACE(pretty ? "indented" : "compact");
        NovirSite site;
        site.serverId = u"cfg-it"_s;
        site.partSize = 2; // the all-cameras answer comes in three parts
        site.prettyXml = pretty;
        site.cameras = {camera(u"A"_s, 18101, u"Loc1"_s), camera(u"B"_s, 18102, u"Loc2"_s),
                        camera(u"C"_s, 18103, u"Loc3"_s), camera(u"D"_s, 18104, QString()),
                        camera(u"E"_s, 18105, u"Loc5"_s), camera(u"F"_s, 18106, u"Loc6"_s)};
        site.cameras[2].online = false;
        site.cameras[4].protectCap = true;
        site.cameras[5].recordCap = false;
        NovirConfigServer server(site);
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
        EXPECT_EQ(collector.getCameraNodeID(u"Loc3"_s), u"C"_s); // offline, still located

        server.setCameraOnline(u"C"_s, true);
        server.setCameraOnline(u"A"_s, false);
        server.changeCamera(camera(u"B"_s, 18202, u"Loc2"_s));
        server.addCamera(camera(u"G"_s, 18107, u"Loc7"_s));
        ASSERT_TRUE(directoryIs(
            u"B(18202,Loc2,1,true) C(18103,Loc3,1,true) E(18105,Loc5,1,true) G(18107,Loc7,1,true)"_s));
        server.removeChannel(u"C"_s);
        server.addChannel(u"D"_s, u"Loc4"_s, 2);
        server.removeCamera(u"E"_s);
        ASSERT_TRUE(directoryIs(u"B(18202,Loc2,1,true) D(18104,Loc4,2,true) G(18107,Loc7,1,true)"_s));
        EXPECT_EQ(removedLocations, QStringList{u"C"_s});
    }
}

TEST_F(TunnelControlTest, EachConnectionStartsItsWork)
{
    client.connectServer(ConfigServer, false);
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
    EXPECT_TRUE(client.requests.at(3).serverId == u"a<b>&c"_s &&
                client.requests.at(4).type == LocationServer);
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
    const QVariantMap cameras = announced(ConfigServer, "nodeinfo_edge_cases.xml");
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

    const QVariantMap locations = announced(LocationServer, "locations_two_lists.xml");
    EXPECT_EQ(locations.keys(), (QStringList{QString(), u"CamA"_s, u"CamB"_s, u"CamC"_s, u"Repeated"_s}));
    const QString located = u"CamA.Location=Loc1 CamA.GroupID=1 CamA.IsRecording=true CamC.IsRecording=false "
                            ".Location=Loc4 Repeated.Location=Loc9"_s;
    EXPECT_EQ(valuesFor(locations, located), located.toStdString());
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
}

TEST_F(TunnelControlTest, BroadcastsStatusEventsAndLateCallbacksAfterDestruction)
{
    client.connectServer(ConfigServer);
    take();
    const QString status = u"<CamStatus><Cam><Name>A</Name><ConnState>Connected</ConnState></Cam>"_s;
    // "broadcast name or status:<source>|relay path|message|expected events, "+" between them"
    const QString rows[] = {
        u"CamIns||<CamIns><Entry><Name>New &amp; &lt;Cam&gt;</Name></Entry></CamIns>|"
        "sent GetNodeInfo <GetNodeInfo><Node>New &amp; &lt;Cam&gt;</Node></GetNodeInfo>"_s,
        u"CamInfoChange||<CamInfoChange><Cam>Lobby</Cam></CamInfoChange>|"
        "sent GetNodeInfo <GetNodeInfo><Node>Lobby</Node></GetNodeInfo>"_s,
        u"CamRmv||<CamRm><Name>Gone</Name></CamRm>|removed Gone"_s,
        u"ChannelAdd||<ChannelAdd><CamName>Lobby</CamName><Loc>Loc12</Loc><GrpID>3</GrpID></ChannelAdd>|"
        "located Lobby {\"GroupID\":3,\"IsRecording\":true,\"Location\":\"Loc12\"}"_s,
        u"ChannelRmv||<ChannelRmv><CamName>Lobby</CamName></ChannelRmv>|unlocated Lobby"_s,
        u"CamRmv|relay/1|<CamRm><Name>Gone</Name></CamRm>|"_s,
        // Connected exactly, from this server, not relayed.
        u"status:srv-1||"_s + status +
            u"<Cam><Name>B</Name><ConnState>connected</ConnState></Cam></CamStatus>|"
            "status A on+status B off"_s,
        u"status:other||"_s + status + u"</CamStatus>|"_s,
        u"status:srv-1|relay/2|"_s + status + u"</CamStatus>|"_s,
    };
    for (const QString& row : rows) {
        const QStringList f = row.split(u'|');
        if (f[0].startsWith(u"status:"_s)) {
            client.statusEvent(f[0].mid(7), f[1], f[2]);
        } else {
            client.broadcast(f[0], f[1], f[2]);
        }
        EXPECT_EQ(take(), f[3].split(u'+', Qt::SkipEmptyParts)) << qPrintable(row);
    }

    // Late callbacks after the control is gone find its guard.
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
