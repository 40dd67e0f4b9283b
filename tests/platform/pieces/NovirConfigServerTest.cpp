// The configuration-server simulator: site files, answers in parts, connection states, every callback from
// its own thread. Site changes and ingest are followed end to end by the camera directory's integration test.
#include "NovirConfigServer.h"
#include "Quellon.h"
#include "TestWait.h"

#include <QCoreApplication>
#include <QMutex>
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

// What the server called back: "connect:<type>=<up>" or "<cmd>:<success>:<retCode>:<finish>", and texts.
struct Calls
{
    QMutex mutex;
    QStringList log, texts;
    bool offThread = true; // every call came from the server's thread
    void add(const QString& entry, const QString& text = {})
    {
        QMutexLocker lock(&mutex);
        log << entry, texts << text, offThread = offThread && QThread::currentThread() != qApp->thread();
    }
    bool has(const QString& entry)
    {
        QMutexLocker lock(&mutex);
        return log.contains(entry);
    }
};

} // namespace

TEST(NovirSite, SiteFileIsReadAndABadOneLeavesTheSiteAlone)
{
    NovirSite site;
    QString error;
    ASSERT_TRUE(NovirSite::fromJson(
        R"({"serverId":"s9","partSize":2,"cameras":[{"name":"A","port":1234,"useSSL":true,"httpsPort":4443,
        "password":"pw","protected":true,"channels":3,"channel":2,"location":"Loc5","groupId":4,"live":false,
        "online":false}]})",
        &site, &error))
        << qPrintable(error);
    ASSERT_EQ(site.cameras.size(), 1);
    const NovirCamera& a = site.cameras.first();
    EXPECT_EQ(std::tuple(site.serverId, site.partSize, a.port, a.useSsl, a.httpsPort, a.password,
                         a.protectCap, a.channelCount, a.channel, a.location, a.groupId, a.live, a.online),
              std::tuple(u"s9"_s, 2, 1234, true, 4443, u"pw"_s, true, 3, 2, u"Loc5"_s, 4, false, false));
    for (const char* json :
         {"[]", R"({"cameras":[{"port":80}]})", R"({"cameras":[{"name":"A","port":70000}]})",
          R"({"cameras":[{"name":"A"},{"name":"A"}]})", R"({"partSize":0,"cameras":[]})"}) {
        EXPECT_FALSE(NovirSite::fromJson(json, &site, &error) || site.serverId != u"s9"_s) << json;
    }
    EXPECT_FALSE(NovirSite::fromFile(u"/nonexistent/site.json"_s, &site, &error));

    NovirCamera odd; // texts are escaped
    odd.name = u"A<&>B"_s;
    odd.location = u"Loc1"_s;
    EXPECT_EQ(valuesAt(NovirSite::nodeInfoXml({odd}), u"NodeInfo/Cameras/Cam/Name"_s) +
                  valuesAt(NovirSite::locationsXml({odd}), u"LocRecs/LocList/Loc/Alias"_s),
              (QStringList{odd.name, odd.name}));
}

TEST(NovirServer, AnswersComeInPartsFromTheServerThreadAndADownServerTakesNoRequest)
{
    Calls calls; // outlives the server, which calls back until its thread stops
    NovirSite site = NovirSite::defaultSite();
    site.partSize = 3;
    NovirConfigServer server(site);
    server.registerConnectStatusHandler(
        kPlugin, NSNovirTunnelClient::ConnectStatus,
        [&](Qt::HANDLE, NSNovirTunnelClient::ServerType type, bool up) {
            calls.add(u"connect:%1=%2"_s.arg(int(type)).arg(up));
        },
        QString());
    server.start();
    ASSERT_TRUE(waitFor([&] { return calls.has(u"connect:4=1"_s); }));
    // Sends a request and gives the log and texts of its parts.
    const auto ask = [&](const QString& cmd, const QString& content, NSNovirTunnelClient::ServerType type) {
        calls.log.clear(), calls.texts.clear(); // the server is idle between requests
        EXPECT_TRUE(server.insertRequest(
            kPlugin, server.getServerAccountID(), type, cmd,
            {0,
             15000,
             content,
             {},
             [&](bool success, const QString& cmd, const QString&, const QString& retCode,
                 const QString& text, bool finish) {
                 calls.add(u"%1:%2:%3:%4"_s.arg(cmd).arg(success).arg(retCode).arg(finish), text);
             }}));
        server.flush();
        return std::pair(calls.log.join(u' '), calls.texts);
    };
    QStringList names, expected;
    for (const NovirCamera& camera : site.cameras) {
        expected << camera.name << (camera.location.isEmpty() ? QStringList() : QStringList{camera.name});
    }
    const auto [nodes, nodeTexts] =
        ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>"_s, ConfigServer);
    EXPECT_EQ(nodes, u"GetNodeInfo:1:0:0 GetNodeInfo:1:0:0 GetNodeInfo:1:0:1"_s); // 8 cameras, 3 a part
    const auto [locations, locationTexts] =
        ask(u"QryLocs"_s, u"<QryLocs><LiveOnly>false</LiveOnly></QryLocs>"_s, LocationServer);
    EXPECT_EQ(locations, u"QryLocs:1:0:0 QryLocs:1:0:0 QryLocs:1:0:1"_s);
    for (int i = 0; i < 3; ++i) {
        names += valuesAt(nodeTexts[i], u"NodeInfo/Cameras/Cam/Name"_s) +
                 valuesAt(locationTexts[i], u"LocRecs/LocList/Loc/Alias"_s);
    }
    names.sort(), expected.sort();
    EXPECT_EQ(names, expected);
    const auto lobby =
        ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>Lobby</Node></GetNodeInfo>"_s, ConfigServer);
    EXPECT_EQ(valuesAt(lobby.second.value(0), u"NodeInfo/Cameras/Cam/Name"_s), QStringList{u"Lobby"_s});
    EXPECT_EQ(ask(u"NoSuchCommand"_s, QString(), ConfigServer).first, u"NoSuchCommand:0:-1:1"_s);
    EXPECT_TRUE(calls.offThread);

    server.setServerConnected(LocationServer, false);
    EXPECT_TRUE(waitFor([&] { return calls.has(u"connect:4=0"_s); }));
    EXPECT_FALSE(server.insertRequest(kPlugin, nullptr, LocationServer, u"QryLocs"_s, {}));
}
