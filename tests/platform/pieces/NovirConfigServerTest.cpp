// The configuration-server simulator: site files, answers in parts, connection states, broadcasts
// and status events on site changes, ingest into the store, and every callback from its own thread.
#include "NovirConfigServer.h"
#include "Quellon.h"
#include "TestWait.h"

#include <QFile>
#include <QMutex>
#include <QTemporaryDir>
#include <QThread>
#include <gtest/gtest.h>

using namespace Qt::StringLiterals;
using NSNovirTunnelClient::ConfigServer;
using NSNovirTunnelClient::LocationServer;

namespace {

const QString kPlugin = u"test-plugin"_s;

// The texts at `path` (element names split by '/') of an answer, every occurrence of every step.
QStringList valuesAt(const QString& xml, const QString& path)
{
    QVariantList nodes{Quellon().parse(xml)};
    for (const QString& step : path.split(u'/')) {
        for (const QVariant& node : std::exchange(nodes, {})) {
            nodes += Quellon::transContentAsList(node.toMap().value(step));
        }
    }
    QStringList texts;
    for (const QVariant& node : nodes) {
        texts << node.toString();
    }
    return texts;
}

class NovirServerTest : public ::testing::Test
{
protected:
    // One thing the server called: "connect:<kind>", "part:<cmd>", "broadcast:<name>", "event:<source>".
    struct Call
    {
        QString what, retCode, text;
        bool success, finish;
        QThread* thread;
    };
    void record(const QString& what, bool success, const QString& text = {}, const QString& retCode = {},
                bool finish = false)
    {
        QMutexLocker lock(&mutex);
        calls.append({what, retCode, text, success, finish, QThread::currentThread()});
    }
    QList<Call> matching(const QString& what, int from = 0)
    {
        QMutexLocker lock(&mutex);
        QList<Call> found;
        std::copy_if(calls.begin() + from, calls.end(), std::back_inserter(found),
                     [&](const Call& call) { return call.what == what; });
        return found;
    }
    int count()
    {
        QMutexLocker lock(&mutex);
        return int(calls.size());
    }
    NSNovirTunnelClient::RequestInfo request(const QString& content)
    {
        return {0,
                15000,
                content,
                {},
                [this](bool success, const QString& cmd, const QString&, const QString& retCode,
                       const QString& text,
                       bool finish) { record(u"part:"_s + cmd, success, text, retCode, finish); }};
    }
    void startServer(const QString& storeDir = QString())
    {
        const int from = count();
        server = std::make_unique<NovirConfigServer>(site);
        QString error;
        ASSERT_TRUE(storeDir.isEmpty() || server->openStore(storeDir, &error)) << qPrintable(error);
        server->registerConnectStatusHandler(
            kPlugin, NSNovirTunnelClient::ConnectStatus,
            [this](Qt::HANDLE, NSNovirTunnelClient::ServerType type, bool up) {
                record(u"connect:%1"_s.arg(int(type)), up);
            },
            QString());
        server->start();
        ASSERT_TRUE(waitFor([&] { return matching(u"connect:4"_s, from).size() == 1; }));
    }
    // Sends a request and waits for its last part; gives the parts.
    QList<Call> ask(const QString& cmd, const QString& content,
                    NSNovirTunnelClient::ServerType type = ConfigServer)
    {
        EXPECT_TRUE(
            server->insertRequest(kPlugin, server->getServerAccountID(), type, cmd, request(content)));
        server->flush();
        auto parts = matching(u"part:"_s + cmd, std::exchange(asked, count()));
        EXPECT_TRUE(!parts.isEmpty() && parts.last().finish) << qPrintable(cmd);
        return parts;
    }

    NovirSite site = NovirSite::defaultSite();
    int asked = 0;
    QMutex mutex;
    QList<Call> calls;                         // guarded by mutex
    std::unique_ptr<NovirConfigServer> server; // destroyed first: stops its thread
};

} // namespace

TEST(NovirSite, SiteFileIsReadAndABadOneLeavesTheSiteAlone)
{
    QTemporaryDir dir;
    QFile file(dir.filePath(u"site.json"_s));
    ASSERT_TRUE(file.open(QIODevice::WriteOnly));
    file.write(
        R"({"serverId":"s9","partSize":2,"cameras":[{"name":"A","port":1234,"useSSL":true,"httpsPort":4443,
        "password":"pw","protected":true,"channels":3,"channel":2,"location":"Loc5","groupId":4,"live":false,
        "online":false}]})");
    file.close();
    NovirSite site;
    QString error;
    ASSERT_TRUE(NovirSite::fromFile(file.fileName(), &site, &error)) << qPrintable(error);
    ASSERT_EQ(site.cameras.size(), 1);
    const NovirCamera& a = site.cameras.first();
    EXPECT_EQ(std::tuple(site.serverId, site.partSize, a.port, a.useSsl, a.httpsPort, a.password,
                         a.protectCap, a.channelCount, a.channel, a.location, a.groupId, a.live, a.online),
              std::tuple(u"s9"_s, 2, 1234, true, 4443, u"pw"_s, true, 3, 2, u"Loc5"_s, 4, false, false));

    for (const char* json :
         {"", "[]", R"({"cameras":{}})", R"({"cameras":[{"port":80}]})",
          R"({"cameras":[{"name":"A","port":70000}]})", R"({"cameras":[{"name":"A","port":"80"}]})",
          R"({"cameras":[{"name":"A","colour":"red"}]})", R"({"cameras":[{"name":"A"},{"name":"A"}]})",
          R"({"partSize":0,"cameras":[]})", R"({"cameras":[1]})",
          R"({"cameras":[{"name":"A","port":80.5}]})"}) {
        error.clear();
        EXPECT_FALSE(NovirSite::fromJson(json, &site, &error) || error.isEmpty()) << json;
        EXPECT_EQ(site.serverId, u"s9"_s);
    }
    EXPECT_FALSE(NovirSite::fromFile(dir.filePath(u"missing.json"_s), &site, &error));

    NovirCamera odd; // texts are escaped
    odd.name = u"A<&>B"_s;
    odd.location = u"Loc1"_s;
    EXPECT_EQ(valuesAt(NovirSite::nodeInfoXml({odd}), u"NodeInfo/Cameras/Cam/Name"_s), QStringList{odd.name});
    EXPECT_EQ(valuesAt(NovirSite::locationsXml({odd}), u"LocRecs/LocList/Loc/Alias"_s),
              QStringList{odd.name});
}

TEST_F(NovirServerTest, ConnectionStatesComeFromTheServerThreadAndADownServerTakesNoRequest)
{
    startServer();
    const auto connects = matching(u"connect:1"_s) + matching(u"connect:4"_s);
    ASSERT_EQ(connects.size(), 2);
    for (const Call& call : connects) {
        EXPECT_TRUE(call.success && call.thread != QThread::currentThread());
    }
    EXPECT_EQ(server->getServerInfo(server->getServerAccountID(), 3), QVariant()); // not a server handle
    // A handler registered later learns of the servers already up.
    std::atomic<int> late{0};
    server->registerConnectStatusHandler(
        kPlugin, NSNovirTunnelClient::ConnectStatus,
        [&](Qt::HANDLE id, NSNovirTunnelClient::ServerType type, bool) {
            late += type == ConfigServer && server->getServerInfo(id, 3).toString() == site.serverId ? 1 : 0;
        },
        QString());
    EXPECT_TRUE(waitFor([&] { return late == 1; }));

    server->setServerConnected(LocationServer, false);
    EXPECT_TRUE(waitFor([&] { return matching(u"connect:4"_s).size() == 2; }));
    EXPECT_FALSE(matching(u"connect:4"_s).last().success);
    EXPECT_FALSE(
        server->insertRequest(kPlugin, nullptr, LocationServer, u"QryLocs"_s, request(u"<QryLocs/>"_s)));
}

TEST_F(NovirServerTest, NodeInfoAndLocationsComeInParts)
{
    site.partSize = 3;
    startServer();
    QStringList names, expected, aliases, expectedAliases;
    for (const NovirCamera& camera : site.cameras) {
        expected << camera.name;
        expectedAliases << (camera.location.isEmpty() ? QStringList() : QStringList{camera.name});
    }
    const auto parts = ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>"_s);
    ASSERT_EQ(parts.size(), 3); // 8 cameras, 3 a part
    for (const Call& part : parts) {
        EXPECT_TRUE(part.success && part.retCode == u"0"_s && part.thread != QThread::currentThread());
        EXPECT_EQ(part.finish, &part == &parts.last());
        names += valuesAt(part.text, u"NodeInfo/Cameras/Cam/Name"_s);
    }
    const auto lobby = ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>Lobby</Node></GetNodeInfo>"_s);
    EXPECT_EQ(valuesAt(lobby.first().text, u"NodeInfo/Cameras/Cam/Name"_s), QStringList{u"Lobby"_s});
    const auto locations =
        ask(u"QryLocs"_s, u"<QryLocs><LiveOnly>false</LiveOnly></QryLocs>"_s, LocationServer);
    EXPECT_EQ(locations.size(), 3);
    for (const Call& part : locations) {
        aliases += valuesAt(part.text, u"LocRecs/LocList/Loc/Alias"_s);
    }
    for (QStringList* list : {&names, &expected, &aliases, &expectedAliases}) {
        list->sort();
    }
    EXPECT_EQ(names, expected);
    EXPECT_EQ(aliases, expectedAliases);
    const auto unknown = ask(u"NoSuchCommand"_s, QString());
    EXPECT_TRUE(unknown.size() == 1 && !unknown[0].success && unknown[0].retCode == u"-1"_s);
}

TEST_F(NovirServerTest, SiteChangesReachListenersAndSubscribers)
{
    startServer();
    for (const char* name : {"CamIns", "CamRmv", "CamInfoChange", "ChannelAdd", "ChannelRmv"}) {
        server->registerBroadcastHandler(
            kPlugin, server->getServerAccountID(), ConfigServer, QLatin1String(name),
            [this](Qt::HANDLE, const QString& broadcast, NSNovirTunnelClient::ServerType, const QString&,
                   const QString& message) { record(u"broadcast:"_s + broadcast, true, message); },
            QString());
    }
    const auto subscribe = [this](const QString& serverId) {
        return server->insertSubscribeRequest(
            kPlugin, server->getServerAccountID(), ConfigServer, u"SubCamStatus"_s,
            request(u"<SubCamStatus><SID>%1</SID></SubCamStatus>"_s.arg(serverId)), serverId,
            [this](Qt::HANDLE, const QString& source, const QString&, NSNovirTunnelClient::ServerType,
                   const QString&, const QString& message) { record(u"event:"_s + source, true, message); });
    };
    EXPECT_FALSE(subscribe(u"another-server"_s));
    ASSERT_TRUE(subscribe(site.serverId));
    server->flush();
    // The subscription is answered, and its first event holds every camera's present state.
    EXPECT_EQ(matching(u"part:SubCamStatus"_s).size(), 1);
    const auto first = matching(u"event:"_s + site.serverId);
    ASSERT_EQ(first.size(), 1);
    const QStringList names = valuesAt(first[0].text, u"CamStatus/Cam/Name"_s);
    const QStringList states = valuesAt(first[0].text, u"CamStatus/Cam/ConnState"_s);
    EXPECT_TRUE(states.contains(u"Disconnected"_s));
    for (const NovirCamera& camera : site.cameras) {
        EXPECT_EQ(states.value(names.indexOf(camera.name)),
                  camera.online ? u"Connected"_s : u"Disconnected"_s);
    }

    NovirCamera dock;
    dock.name = u"Dock"_s;
    dock.location = u"Loc20"_s;
    const struct
    {
        std::function<void()> change;
        QString what, text; // no text: nothing at all is sent
    } rows[] = {
        {[&] { server->addCamera(dock); }, u"broadcast:CamIns"_s,
         u"<CamIns><Entry><Name>Dock</Name></Entry></CamIns>"_s},
        {[&] { server->changeCamera(dock); }, u"broadcast:CamInfoChange"_s,
         u"<CamInfoChange><Cam>Dock</Cam></CamInfoChange>"_s},
        {[&] { server->removeChannel(u"Dock"_s); }, u"broadcast:ChannelRmv"_s,
         u"<ChannelRmv><CamName>Dock</CamName></ChannelRmv>"_s},
        {[&] { server->addChannel(u"Dock"_s, u"Loc21"_s, 4); }, u"broadcast:ChannelAdd"_s,
         u"<ChannelAdd><CamName>Dock</CamName><Loc>Loc21</Loc><GrpID>4</GrpID></ChannelAdd>"_s},
        {[&] { server->setCameraOnline(u"Lobby"_s, false); }, u"event:"_s + site.serverId,
         u"<CamStatus><Cam><Name>Lobby</Name><ConnState>Disconnected</ConnState></Cam></CamStatus>"_s},
        {[&] { server->removeCamera(u"Dock"_s); }, u"broadcast:CamRmv"_s,
         u"<CamRm><Name>Dock</Name></CamRm>"_s},
        {[&] { server->removeCamera(u"Dock"_s); }, u"broadcast:CamRmv"_s, QString()}, // already gone
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.what.toStdString() + " " + row.text.toStdString());
        const int from = count();
        row.change();
        server->flush(); // every callback of the change has run
        const auto sent = matching(row.what, from);
        EXPECT_EQ(count() == from, row.text.isEmpty());
        if (!row.text.isEmpty()) {
            ASSERT_EQ(sent.size(), 1);
            EXPECT_TRUE(sent[0].text == row.text && sent[0].thread != QThread::currentThread())
                << qPrintable(sent[0].text);
        }
    }
}

TEST_F(NovirServerTest, InputObjectMetaInfoIsStoredWhenAStoreIsOpen)
{
    QTemporaryDir dir;
    const QString object =
        u"{\"ID\":%1,\"ObjectType\":\"Vehicle\",\"StartTime\":1700000000,\"EndTime\":1700000010,"
        "\"Attributes\":{\"PlateNumber\":\"AB&amp;C\"},\"Trajectory\":[{\"x\":0.1,\"y\":0.2}],"
        "\"Thumbnail\":[]}"_s;
    const QString message = u"<InputObjectMetaInfo><GroupID>1</GroupID><LocationID>4</LocationID><StartTime>1"
                            "</StartTime><EndTime>2</EndTime><Info>{\"ObjectMetaInfo\":[%1,%2]}</Info>"
                            "</InputObjectMetaInfo>"_s.arg(object.arg(1), object.arg(2));
    startServer();
    EXPECT_FALSE(ask(u"InputObjectMetaInfo"_s, message).first().success); // no store
    server.reset();
    startServer(dir.filePath(u"Server"_s));
    const auto stored = ask(u"InputObjectMetaInfo"_s, message);
    EXPECT_TRUE(stored.size() == 1 && stored[0].success) << qPrintable(stored.first().text);
    EXPECT_FALSE(ask(u"InputObjectMetaInfo"_s, u"<InputObjectMetaInfo><GroupID>x"_s).first().success);
    EXPECT_EQ(server->ingestedObjects(), 2);
}
