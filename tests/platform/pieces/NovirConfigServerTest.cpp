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
        QVariantList next;
        for (const QVariant& node : nodes) {
            next += Quellon::transContentAsList(node.toMap().value(step));
        }
        nodes = next;
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
    // One thing the server called: "connect:<kind>", "part:<cmd>", "broadcast:<name>" or "event".
    struct Call
    {
        QString what;
        bool success = false;
        QString retCode;
        QString text;
        bool finish = false;
        QString sourceId;
        QThread* thread = nullptr;
    };

    void SetUp() override { site.partSize = 3; }

    void record(const QString& what, bool success, const QString& retCode = {}, const QString& text = {},
                bool finish = false, const QString& sourceId = {})
    {
        QMutexLocker lock(&mutex);
        calls.append({what, success, retCode, text, finish, sourceId, QThread::currentThread()});
    }
    QList<Call> matching(const QString& what, int from = 0)
    {
        QMutexLocker lock(&mutex);
        QList<Call> found;
        for (const Call& call : calls.mid(from)) {
            if (call.what == what) {
                found.append(call);
            }
        }
        return found;
    }
    int callCount()
    {
        QMutexLocker lock(&mutex);
        return int(calls.size());
    }
    NSNovirTunnelClient::RequestInfo request(const QString& content)
    {
        NSNovirTunnelClient::RequestInfo info;
        info.strContent = content;
        info.respCB = [this](bool success, const QString& cmd, const QString&, const QString& retCode,
                             const QString& text,
                             bool finish) { record(u"part:"_s + cmd, success, retCode, text, finish); };
        return info;
    }

    void startServer(const QString& storeDir = QString())
    {
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
        ASSERT_TRUE(waitFor([&] { return matching(u"connect:4"_s).size() == 1; }));
    }

    // Sends a request and waits for its last part; gives the parts.
    QList<Call> ask(const QString& cmd, const QString& content,
                    NSNovirTunnelClient::ServerType type = ConfigServer)
    {
        const int from = callCount();
        EXPECT_TRUE(
            server->insertRequest(kPlugin, server->getServerAccountID(), type, cmd, request(content)));
        EXPECT_TRUE(waitFor([&] {
            const auto parts = matching(u"part:"_s + cmd, from);
            return !parts.isEmpty() && parts.last().finish;
        })) << qPrintable(cmd);
        return matching(u"part:"_s + cmd, from);
    }

    NovirSite site = NovirSite::defaultSite();
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
    file.write(R"({"serverId":"s9","partSize":2,"cameras":[{"name":"A","port":1234,"useSSL":true,
        "httpsPort":4443,"password":"pw","protected":true,"channels":3,"channel":2,"location":"Loc5",
        "groupId":4,"live":false,"online":false}]})");
    file.close();
    NovirSite loaded;
    QString error;
    ASSERT_TRUE(NovirSite::fromFile(file.fileName(), &loaded, &error)) << qPrintable(error);
    EXPECT_EQ(loaded.serverId, u"s9"_s);
    EXPECT_EQ(loaded.partSize, 2);
    ASSERT_EQ(loaded.cameras.size(), 1);
    const NovirCamera& a = loaded.cameras.first();
    EXPECT_EQ(std::tuple(a.port, a.useSsl, a.httpsPort, a.password, a.protectCap, a.channelCount, a.channel,
                         a.location, a.groupId, a.live, a.online),
              std::tuple(1234, true, 4443, u"pw"_s, true, 3, 2, u"Loc5"_s, 4, false, false));

    for (const char* json :
         {"", "[]", R"({"cameras":{}})", R"({"cameras":[{"port":80}]})",
          R"({"cameras":[{"name":"A","port":70000}]})", R"({"cameras":[{"name":"A","port":"80"}]})",
          R"({"cameras":[{"name":"A","colour":"red"}]})", R"({"cameras":[{"name":"A"},{"name":"A"}]})",
          R"({"partSize":0,"cameras":[]})", R"({"cameras":[1]})",
          R"({"cameras":[{"name":"A","port":80.5}]})"}) {
        NovirSite untouched;
        untouched.serverId = u"keep"_s;
        error.clear();
        EXPECT_FALSE(NovirSite::fromJson(json, &untouched, &error)) << json;
        EXPECT_FALSE(error.isEmpty());
        EXPECT_EQ(untouched.serverId, u"keep"_s);
    }
    EXPECT_FALSE(NovirSite::fromFile(dir.filePath(u"missing.json"_s), &loaded, &error));
}

TEST(NovirSite, TextsAreEscaped)
{
    NovirCamera camera;
    camera.name = u"A<&>B"_s;
    camera.password = u"p"_s;
    camera.location = u"Loc1"_s;
    EXPECT_EQ(valuesAt(NovirSite::nodeInfoXml({camera}), u"NodeInfo/Cameras/Cam/Name"_s),
              QStringList{camera.name});
    EXPECT_EQ(valuesAt(NovirSite::nodeInfoXml({camera}), u"NodeInfo/Cameras/Cam/Pwd"_s),
              QStringList{u"70"_s});
    EXPECT_EQ(valuesAt(NovirSite::locationsXml({camera}), u"LocRecs/LocList/Loc/Alias"_s),
              QStringList{camera.name});
}

TEST_F(NovirServerTest, ConnectionStatesComeFromTheServerThreadAndADownServerTakesNoRequest)
{
    startServer();
    const auto connects = matching(u"connect:1"_s) + matching(u"connect:4"_s);
    ASSERT_EQ(connects.size(), 2);
    for (const Call& call : connects) {
        EXPECT_TRUE(call.success);
        EXPECT_NE(call.thread, QThread::currentThread());
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
    startServer();
    const auto parts = ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>"_s);
    ASSERT_EQ(parts.size(), 3); // 8 cameras, 3 a part
    QStringList names, expected, aliases, expectedAliases;
    for (int i = 0; i < parts.size(); ++i) {
        EXPECT_TRUE(parts[i].success);
        EXPECT_EQ(parts[i].retCode, u"0"_s);
        EXPECT_EQ(parts[i].finish, i == parts.size() - 1);
        EXPECT_NE(parts[i].thread, QThread::currentThread());
        names += valuesAt(parts[i].text, u"NodeInfo/Cameras/Cam/Name"_s);
    }
    for (const NovirCamera& camera : site.cameras) {
        expected << camera.name;
        if (!camera.location.isEmpty()) {
            expectedAliases << camera.name;
        }
    }
    names.sort();
    expected.sort();
    EXPECT_EQ(names, expected);

    const auto lobby = ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>Lobby</Node></GetNodeInfo>"_s);
    ASSERT_EQ(lobby.size(), 1);
    EXPECT_EQ(valuesAt(lobby[0].text, u"NodeInfo/Cameras/Cam/Name"_s), QStringList{u"Lobby"_s});
    const auto nobody = ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>Nobody</Node></GetNodeInfo>"_s);
    EXPECT_TRUE(valuesAt(nobody[0].text, u"NodeInfo/Cameras/Cam/Name"_s).isEmpty());

    const auto locations =
        ask(u"QryLocs"_s, u"<QryLocs><LiveOnly>false</LiveOnly></QryLocs>"_s, LocationServer);
    EXPECT_EQ(locations.size(), 3);
    for (const Call& part : locations) {
        aliases += valuesAt(part.text, u"LocRecs/LocList/Loc/Alias"_s);
    }
    aliases.sort();
    expectedAliases.sort();
    EXPECT_EQ(aliases, expectedAliases);

    const auto unknown = ask(u"NoSuchCommand"_s, QString());
    ASSERT_EQ(unknown.size(), 1);
    EXPECT_FALSE(unknown[0].success);
    EXPECT_EQ(unknown[0].retCode, u"-1"_s);
}

TEST_F(NovirServerTest, SiteChangesReachListenersAndSubscribers)
{
    startServer();
    for (const char* name : {"CamIns", "CamRmv", "CamInfoChange", "ChannelAdd", "ChannelRmv"}) {
        server->registerBroadcastHandler(
            kPlugin, server->getServerAccountID(), ConfigServer, QLatin1String(name),
            [this](Qt::HANDLE, const QString& broadcast, NSNovirTunnelClient::ServerType, const QString&,
                   const QString& message) { record(u"broadcast:"_s + broadcast, true, {}, message); },
            QString());
    }
    const auto subscribe = [this](const QString& serverId) {
        return server->insertSubscribeRequest(
            kPlugin, server->getServerAccountID(), ConfigServer, u"SubCamStatus"_s,
            request(u"<SubCamStatus><SID>%1</SID></SubCamStatus>"_s.arg(serverId)), serverId,
            [this](Qt::HANDLE, const QString& sourceId, const QString&, NSNovirTunnelClient::ServerType,
                   const QString&,
                   const QString& message) { record(u"event"_s, true, {}, message, false, sourceId); });
    };
    EXPECT_FALSE(subscribe(u"another-server"_s));
    ASSERT_TRUE(subscribe(site.serverId));
    server->flush();
    // The subscription is answered, and its first event holds every camera's present state.
    EXPECT_EQ(matching(u"part:SubCamStatus"_s).size(), 1);
    const auto first = matching(u"event"_s);
    ASSERT_EQ(first.size(), 1);
    EXPECT_EQ(first[0].sourceId, site.serverId);
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
    struct Row
    {
        std::function<void()> change;
        QString what;
        QString text; // empty: nothing at all is sent
    };
    const Row rows[] = {
        {[&] { server->addCamera(dock); }, u"broadcast:CamIns"_s,
         u"<CamIns><Entry><Name>Dock</Name></Entry></CamIns>"_s},
        {[&] { server->changeCamera(dock); }, u"broadcast:CamInfoChange"_s,
         u"<CamInfoChange><Cam>Dock</Cam></CamInfoChange>"_s},
        {[&] { server->removeChannel(u"Dock"_s); }, u"broadcast:ChannelRmv"_s,
         u"<ChannelRmv><CamName>Dock</CamName></ChannelRmv>"_s},
        {[&] { server->addChannel(u"Dock"_s, u"Loc21"_s, 4); }, u"broadcast:ChannelAdd"_s,
         u"<ChannelAdd><CamName>Dock</CamName><Loc>Loc21</Loc><GrpID>4</GrpID></ChannelAdd>"_s},
        {[&] { server->setCameraOnline(u"Lobby"_s, false); }, u"event"_s,
         u"<CamStatus><Cam><Name>Lobby</Name><ConnState>Disconnected</ConnState></Cam></CamStatus>"_s},
        {[&] { server->removeCamera(u"Dock"_s); }, u"broadcast:CamRmv"_s,
         u"<CamRm><Name>Dock</Name></CamRm>"_s},
        {[&] { server->removeCamera(u"Dock"_s); }, u"broadcast:CamRmv"_s, QString()}, // already gone
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what.toStdString() + " " + row.text.toStdString());
        const int from = callCount();
        row.change();
        server->flush(); // every callback of the change has run
        const auto sent = matching(row.what, from);
        if (row.text.isEmpty()) {
            EXPECT_EQ(callCount(), from);
            continue;
        }
        ASSERT_EQ(sent.size(), 1);
        EXPECT_EQ(sent[0].text, row.text);
        EXPECT_NE(sent[0].thread, QThread::currentThread());
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
    ASSERT_EQ(stored.size(), 1);
    EXPECT_TRUE(stored[0].success) << qPrintable(stored[0].text);
    EXPECT_EQ(server->ingestedObjects(), 2);
    EXPECT_FALSE(ask(u"InputObjectMetaInfo"_s, u"<InputObjectMetaInfo><GroupID>x"_s).first().success);
    EXPECT_EQ(server->ingestedObjects(), 2);
}
