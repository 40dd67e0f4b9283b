// The configuration-server simulator: site files, answers in parts, subscriptions, broadcasts on
// site changes, ingest into the store, and that every callback comes from its own thread.
#include "NovirConfigServer.h"
#include "Quellon.h"

#include <QCoreApplication>
#include <QDeadlineTimer>
#include <QFile>
#include <QMutex>
#include <QTemporaryDir>
#include <QThread>
#include <functional>
#include <gtest/gtest.h>

using namespace Qt::StringLiterals;

namespace {

using NSNovirTunnelClient::ConfigServer;
using NSNovirTunnelClient::LocationServer;

const QString kPlugin = u"test-plugin"_s;

// Everything the server called, from whichever thread.
struct Recorder
{
    struct Call
    {
        QString what; // "connect:<kind>", "part:<cmd>", "broadcast:<name>", "event"
        bool success = false;
        QString retCode;
        QString text;
        bool finish = false;
        QString sourceId;
        QThread* thread = nullptr;
    };
    mutable QMutex mutex;
    QList<Call> calls;

    void add(Call call)
    {
        call.thread = QThread::currentThread();
        QMutexLocker locker(&mutex);
        calls.append(call);
    }
    QList<Call> matching(const QString& what) const
    {
        QMutexLocker locker(&mutex);
        QList<Call> result;
        for (const Call& call : calls) {
            if (call.what == what) {
                result.append(call);
            }
        }
        return result;
    }
    NSNovirTunnelClient::RequestInfo request(const QString& content)
    {
        NSNovirTunnelClient::RequestInfo info;
        info.strContent = content;
        info.respCB = [this](bool success, const QString& cmd, const QString&, const QString& rc,
                             const QString& text, bool finish) {
            add(Call{u"part:"_s + cmd, success, rc, text, finish, {}, nullptr});
        };
        return info;
    }
};

bool waitFor(const std::function<bool()>& condition)
{
    QDeadlineTimer deadline(10000);
    while (!condition()) {
        if (deadline.hasExpired()) {
            return false;
        }
        QCoreApplication::processEvents();
        QThread::msleep(2);
    }
    return true;
}

QStringList namesIn(const QString& xml, const char* root, const char* list, const char* entry,
                    const char* key)
{
    Quellon quellon;
    QStringList names;
    QVariant node = quellon.parse(xml).toMap().value(QLatin1String(root));
    if (list) {
        node = node.toMap().value(QLatin1String(list));
    }
    for (const QVariant& item : Quellon::transContentAsList(node.toMap().value(QLatin1String(entry)))) {
        names << item.toMap().value(QLatin1String(key)).toString();
    }
    return names;
}

class ServerTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        site = NovirSite::defaultSite();
        site.partSize = 3;
    }
    void startServer(const QString& storeDir = QString())
    {
        server = std::make_unique<NovirConfigServer>(site);
        if (!storeDir.isEmpty()) {
            QString error;
            ASSERT_TRUE(server->openStore(storeDir, &error)) << qPrintable(error);
        }
        server->registerConnectStatusHandler(
            kPlugin, NSNovirTunnelClient::ConnectStatus,
            [this](Qt::HANDLE, NSNovirTunnelClient::ServerType type, bool up) {
                recorder.add(Recorder::Call{u"connect:%1"_s.arg(int(type)), up, {}, {}, false, {}, nullptr});
            },
            QString());
        server->start();
        ASSERT_TRUE(waitFor([&] { return recorder.matching(u"connect:4"_s).size() == 1; }));
    }
    void listen(const QString& name)
    {
        server->registerBroadcastHandler(
            kPlugin, server->getServerAccountID(), ConfigServer, name,
            [this](Qt::HANDLE, const QString& broadcastName, NSNovirTunnelClient::ServerType, const QString&,
                   const QString& message) {
                recorder.add(
                    Recorder::Call{u"broadcast:"_s + broadcastName, true, {}, message, false, {}, nullptr});
            },
            QString());
    }
    bool subscribe(const QString& serverId)
    {
        return server->insertSubscribeRequest(
            kPlugin, server->getServerAccountID(), ConfigServer, u"SubCamStatus"_s,
            recorder.request(u"<SubCamStatus><SID>%1</SID></SubCamStatus>"_s.arg(serverId)), serverId,
            [this](Qt::HANDLE, const QString& sourceId, const QString&, NSNovirTunnelClient::ServerType,
                   const QString&, const QString& message) {
                recorder.add(Recorder::Call{u"event"_s, true, {}, message, false, sourceId, nullptr});
            });
    }
    QList<Recorder::Call> ask(const QString& cmd, const QString& content,
                              NSNovirTunnelClient::ServerType type)
    {
        const int before = recorder.matching(u"part:"_s + cmd).size();
        EXPECT_TRUE(server->insertRequest(kPlugin, server->getServerAccountID(), type, cmd,
                                          recorder.request(content)));
        EXPECT_TRUE(waitFor([&] {
            const auto parts = recorder.matching(u"part:"_s + cmd);
            return parts.size() > before && parts.last().finish;
        }));
        return recorder.matching(u"part:"_s + cmd).mid(before);
    }

    NovirSite site;
    Recorder recorder;
    std::unique_ptr<NovirConfigServer> server; // destroyed first: stops its thread
};

} // namespace

TEST(NovirSite, DefaultSiteAndSiteFiles)
{
    const NovirSite site = NovirSite::defaultSite();
    EXPECT_EQ(site.cameras.size(), 8);
    int protectedCount = 0;
    int multiChannel = 0;
    for (const NovirCamera& camera : site.cameras) {
        EXPECT_EQ(camera.ip, u"127.0.0.1"_s);
        protectedCount += camera.protectCap ? 1 : 0;
        multiChannel += camera.channelCount > 1 ? 1 : 0;
    }
    EXPECT_EQ(protectedCount, 1);
    EXPECT_EQ(multiChannel, 2); // one camera, two channel entries

    QTemporaryDir dir;
    const QString path = dir.filePath(u"site.json"_s);
    QFile file(path);
    ASSERT_TRUE(file.open(QIODevice::WriteOnly));
    file.write(
        R"({"serverId":"s9","partSize":2,"cameras":[{"name":"A","port":1234,"useSSL":true,"httpsPort":4443,
        "password":"pw","protected":true,"channels":3,"channel":2,"location":"Loc5","groupId":4,"live":false,
        "online":false}]})");
    file.close();
    NovirSite loaded;
    QString error;
    ASSERT_TRUE(NovirSite::fromFile(path, &loaded, &error)) << qPrintable(error);
    EXPECT_EQ(loaded.serverId, u"s9"_s);
    EXPECT_EQ(loaded.partSize, 2);
    ASSERT_EQ(loaded.cameras.size(), 1);
    const NovirCamera& a = loaded.cameras.first();
    EXPECT_EQ(a.port, 1234);
    EXPECT_TRUE(a.useSsl);
    EXPECT_EQ(a.httpsPort, 4443);
    EXPECT_EQ(a.channelCount, 3);
    EXPECT_EQ(a.location, u"Loc5"_s);
    EXPECT_FALSE(a.live);
    EXPECT_FALSE(a.online);

    const QList<QByteArray> bad = {"",
                                   "[]",
                                   R"({"cameras":{}})",
                                   R"({"cameras":[{"port":80}]})",
                                   R"({"cameras":[{"name":"A","port":70000}]})",
                                   R"({"cameras":[{"name":"A","port":"80"}]})",
                                   R"({"cameras":[{"name":"A","colour":"red"}]})",
                                   R"({"cameras":[{"name":"A"},{"name":"A"}]})",
                                   R"({"partSize":0,"cameras":[]})",
                                   R"({"cameras":[1]})",
                                   R"({"cameras":[{"name":"A","port":80.5}]})"};
    for (const QByteArray& json : bad) {
        NovirSite untouched;
        untouched.serverId = u"keep"_s;
        EXPECT_FALSE(NovirSite::fromJson(json, &untouched, &error)) << json.constData();
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
    const QString xml = NovirSite::nodeInfoXml({camera});
    EXPECT_EQ(namesIn(xml, "NodeInfo", "Cameras", "Cam", "Name"), QStringList{camera.name});
    EXPECT_TRUE(xml.contains(u"<Pwd>70</Pwd>"_s));
    EXPECT_EQ(namesIn(NovirSite::locationsXml({camera}), "LocRecs", "LocList", "Loc", "Alias"),
              QStringList{camera.name});
}

TEST_F(ServerTest, CallbacksComeFromTheServerThreadAfterConnection)
{
    startServer();
    const auto connects = recorder.matching(u"connect:1"_s) + recorder.matching(u"connect:4"_s);
    ASSERT_EQ(connects.size(), 2);
    for (const auto& call : connects) {
        EXPECT_TRUE(call.success);
        EXPECT_NE(call.thread, QThread::currentThread());
    }
    EXPECT_EQ(server->getServerInfo(server->getServerAccountID(), 3), QVariant()); // not a server handle

    // A handler registered later learns of the servers already up.
    std::atomic<int> late{0};
    server->registerConnectStatusHandler(
        kPlugin, NSNovirTunnelClient::ConnectStatus,
        [&](Qt::HANDLE id, NSNovirTunnelClient::ServerType type, bool) {
            if (type == ConfigServer && server->getServerInfo(id, 3).toString() == site.serverId) {
                ++late;
            }
        },
        QString());
    EXPECT_TRUE(waitFor([&] { return late == 1; }));

    server->setServerConnected(LocationServer, false);
    EXPECT_TRUE(waitFor([&] { return recorder.matching(u"connect:4"_s).size() == 2; }));
    EXPECT_FALSE(recorder.matching(u"connect:4"_s).last().success);
    EXPECT_FALSE(server->insertRequest(kPlugin, nullptr, LocationServer, u"QryLocs"_s,
                                       recorder.request(u"<QryLocs/>"_s)));
}

TEST_F(ServerTest, NodeInfoAndLocationsComeInParts)
{
    startServer();
    const auto parts =
        ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>"_s, ConfigServer);
    ASSERT_EQ(parts.size(), 3); // 8 cameras, 3 per part
    QStringList names;
    for (int i = 0; i < parts.size(); ++i) {
        EXPECT_TRUE(parts.at(i).success);
        EXPECT_EQ(parts.at(i).retCode, u"0"_s);
        EXPECT_EQ(parts.at(i).finish, i == parts.size() - 1);
        EXPECT_NE(parts.at(i).thread, QThread::currentThread());
        names += namesIn(parts.at(i).text, "NodeInfo", "Cameras", "Cam", "Name");
    }
    names.sort();
    QStringList expected;
    for (const NovirCamera& camera : site.cameras) {
        expected << camera.name;
    }
    expected.sort();
    EXPECT_EQ(names, expected);

    const auto one = ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>Lobby</Node></GetNodeInfo>"_s, ConfigServer);
    ASSERT_EQ(one.size(), 1);
    EXPECT_EQ(namesIn(one.first().text, "NodeInfo", "Cameras", "Cam", "Name"), QStringList{u"Lobby"_s});
    const auto none =
        ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>Nobody</Node></GetNodeInfo>"_s, ConfigServer);
    EXPECT_TRUE(namesIn(none.first().text, "NodeInfo", "Cameras", "Cam", "Name").isEmpty());

    const auto locations =
        ask(u"QryLocs"_s, u"<QryLocs><LiveOnly>false</LiveOnly></QryLocs>"_s, LocationServer);
    QStringList aliases;
    for (const auto& part : locations) {
        Quellon quellon;
        for (const QVariant& list : Quellon::transContentAsList(
                 quellon.parse(part.text).toMap().value(u"LocRecs"_s).toMap().value(u"LocList"_s))) {
            for (const QVariant& loc : Quellon::transContentAsList(list.toMap().value(u"Loc"_s))) {
                aliases << loc.toMap().value(u"Alias"_s).toString();
            }
        }
    }
    aliases.sort();
    EXPECT_EQ(aliases, (QStringList{u"Entrance"_s, u"Loading"_s, u"Lobby"_s, u"ParkingGate"_s, u"Storage"_s,
                                    u"Warehouse-1"_s, u"Warehouse-2"_s}));
    EXPECT_EQ(locations.size(), 3);

    const auto unknown = ask(u"NoSuchCommand"_s, QString(), ConfigServer);
    EXPECT_FALSE(unknown.first().success);
    EXPECT_EQ(unknown.first().retCode, u"-1"_s);
    EXPECT_GE(server->answeredCount(u"GetNodeInfo"_s), 3);
}

TEST_F(ServerTest, SubscriptionGetsCurrentStatesThenChanges)
{
    startServer();
    EXPECT_FALSE(subscribe(u"another-server"_s));
    ASSERT_TRUE(subscribe(site.serverId));
    ASSERT_TRUE(waitFor([&] { return recorder.matching(u"event"_s).size() == 1; }));
    const auto first = recorder.matching(u"event"_s).first();
    EXPECT_EQ(first.sourceId, site.serverId);
    EXPECT_TRUE(first.text.contains(u"<Name>Loading</Name><ConnState>Disconnected</ConnState>"_s));
    EXPECT_TRUE(first.text.contains(u"<Name>Lobby</Name><ConnState>Connected</ConnState>"_s));
    EXPECT_EQ(recorder.matching(u"part:SubCamStatus"_s).size(), 1);

    server->setCameraOnline(u"Lobby"_s, false);
    ASSERT_TRUE(waitFor([&] { return recorder.matching(u"event"_s).size() == 2; }));
    EXPECT_EQ(recorder.matching(u"event"_s).last().text,
              QStringLiteral(
                  "<CamStatus><Cam><Name>Lobby</Name><ConnState>Disconnected</ConnState></Cam></CamStatus>"));
}

TEST_F(ServerTest, SiteChangesAreBroadcast)
{
    startServer();
    for (const char* name : {"CamIns", "CamRmv", "CamInfoChange", "ChannelAdd", "ChannelRmv"}) {
        listen(QLatin1String(name));
    }
    NovirCamera camera;
    camera.name = u"Dock"_s;
    camera.location = u"Loc20"_s;
    camera.groupId = 3;
    server->addCamera(camera);
    server->changeCamera(camera);
    server->removeChannel(u"Dock"_s);
    server->addChannel(u"Dock"_s, u"Loc21"_s, 4);
    server->removeCamera(u"Dock"_s);
    server->removeCamera(u"Dock"_s); // already gone: nothing
    ASSERT_TRUE(waitFor([&] { return recorder.matching(u"broadcast:CamRmv"_s).size() == 1; }));
    server->flush();
    const std::vector<std::pair<const char*, QString>> expected{
        {"CamIns", u"<CamIns><Entry><Name>Dock</Name></Entry></CamIns>"_s},
        {"ChannelAdd", u"<ChannelAdd><CamName>Dock</CamName><Loc>Loc21</Loc><GrpID>4</GrpID></ChannelAdd>"_s},
        {"CamInfoChange", u"<CamInfoChange><Cam>Dock</Cam></CamInfoChange>"_s},
        {"ChannelRmv", u"<ChannelRmv><CamName>Dock</CamName></ChannelRmv>"_s},
        {"CamRmv", u"<CamRm><Name>Dock</Name></CamRm>"_s}};
    for (const auto& [name, text] : expected) {
        SCOPED_TRACE(name);
        const auto calls = recorder.matching(u"broadcast:"_s + QLatin1String(name));
        const bool channelAdd = QLatin1String(name) == QLatin1String("ChannelAdd");
        ASSERT_EQ(calls.isEmpty(), false);
        EXPECT_EQ((channelAdd ? calls.last() : calls.first()).text, text);
    }
    EXPECT_EQ(recorder.matching(u"broadcast:ChannelAdd"_s).size(), 2);
    EXPECT_EQ(recorder.matching(u"broadcast:CamRmv"_s).size(), 1);
}

TEST_F(ServerTest, InputObjectMetaInfoIsStored)
{
    QTemporaryDir dir;
    startServer();
    const QString message = QStringLiteral(
        "<InputObjectMetaInfo><GroupID>1</GroupID><LocationID>4</LocationID><StartTime>1</StartTime>"
        "<EndTime>2</EndTime><Info>{\"ObjectMetaInfo\":[%1,%2]}</Info></InputObjectMetaInfo>");
    const QString object = QStringLiteral(
        "{\"ID\":%1,\"ObjectType\":\"Vehicle\",\"StartTime\":1700000000,\"EndTime\":1700000010,"
        "\"Attributes\":{\"PlateNumber\":\"AB&amp;C\"},\"Trajectory\":[{\"x\":0.1,\"y\":0.2}],\"Thumbnail\":["
        "]}");
    // Without a store the ingest fails.
    const auto refused =
        ask(u"InputObjectMetaInfo"_s, message.arg(object.arg(1), object.arg(2)), ConfigServer);
    EXPECT_FALSE(refused.first().success);

    server.reset();
    recorder.calls.clear();
    startServer(dir.filePath(u"Server"_s));
    const auto stored =
        ask(u"InputObjectMetaInfo"_s, message.arg(object.arg(1), object.arg(2)), ConfigServer);
    ASSERT_EQ(stored.size(), 1);
    EXPECT_TRUE(stored.first().success) << qPrintable(stored.first().text);
    EXPECT_EQ(server->ingestedObjects(), 2);
    const auto malformed = ask(u"InputObjectMetaInfo"_s, u"<InputObjectMetaInfo><GroupID>x"_s, ConfigServer);
    EXPECT_FALSE(malformed.first().success);
    EXPECT_EQ(server->ingestedObjects(), 2);
}
