// The small platform pieces. The HTTP client against simulated cameras on loopback: every way a call
// can end, each completed once on the owner thread, and the objects a camera answers for a window
// (fetching through access tokens, TLS and channels end to end is the camera synchronisation's
// integration test). The in-process host: the plug-in module loads (a missing one is refused),
// requests run on request threads, the plug-in manager connects plug-in signals, and the relay
// reaches the servers in host.json. The configuration-server simulator: site files, answers in
// parts, connection states, every callback from its own thread (site changes and ingest are followed
// end to end by the camera directory's integration test). The XML converter (tree shape, refusal of
// malformed or hostile input), access tokens (both sides run the same derivation; foreign, tampered
// or late tokens are refused) and the log library.
#include "BookmarkPlugin.h"
#include "BraskHttpClient.h"
#include "CameraSimulator.h"
#include "Faults.h"
#include "NovirConfigServer.h"
#include "PluginHost.h"
#include "Quellon.h"
#include "TestWait.h"
#include "WemloLogUtl.h"
#include "Zelto.h"

#include <QCoreApplication>
#include <QDir>
#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QMutex>
#include <QSettings>
#include <QTcpServer>
#include <QTemporaryDir>
#include <QThread>
#include <QtEndian>
#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <regex>
#include <set>
#include <thread>

using namespace Qt::StringLiterals;
using Error = QNetworkReply::NetworkError;
using NSNovirTunnelClient::ConfigServer;
using NSNovirTunnelClient::LocationServer;

namespace {

struct Outcome
{
    bool accepted = false, abandoned = false; // accepted: what Get returned
    int calls = 0;
    Error error = QNetworkReply::UnknownNetworkError;
    QByteArray body;
    QThread* thread = nullptr;
};

QString window(qint64 start, qint64 end, const QString& prefix = u"/VCA"_s)
{
    return u"%1/Data/DB/ObjectMeta?StartTime=%2&EndTime=%3&Info=127"_s.arg(prefix).arg(start).arg(end);
}

QJsonArray objects(const QByteArray& body)
{
    return QJsonDocument::fromJson(body).object().value(u"ObjectMetaInfo"_s).toArray();
}

class HttpCamerasTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        QList<CameraSetup> setups(6);
        const char* names[] = {"door", "hall", "vault", "yard", "digest", "tls"};
        for (int i = 0; i < 6; ++i) {
            setups[i].name = QLatin1String(names[i]), setups[i].objectsPerMinute = 50;
        }
        setups[2].protectedMetadata = setups[4].digestAuth = setups[5].useSSL = true;
        setups[3].channels = 2;
        ASSERT_TRUE(m_cameras.start(setups));
    }

    // Starts a GET to a camera ("closed": a port nobody listens on; an unknown name: port 0).
    std::shared_ptr<Outcome> get(BraskHttpClient& client, const QString& camera, const QString& path,
                                 const QString& password = u"admin"_s, unsigned int timeoutMs = 10000)
    {
        QTcpServer probe;
        probe.listen(QHostAddress::LocalHost, 0);
        const quint16 port = camera == u"closed"_s ? probe.serverPort() : m_cameras.port(camera);
        probe.close();
        auto out = std::make_shared<Outcome>();
        out->accepted = client.Get(
            u"127.0.0.1"_s, path, port, camera == u"tls"_s, u"admin"_s, password,
            [out](Error error, const QByteArray&, const QByteArray& body, bool abandoned) {
                *out = {out->accepted, abandoned, out->calls + 1, error, body, QThread::currentThread()};
            },
            timeoutMs, {});
        EXPECT_EQ(out->calls, 0) << "completed inside Get";
        return out;
    }
    QByteArray fetch(BraskHttpClient& client, const QString& path)
    {
        auto outcome = get(client, u"hall"_s, path);
        EXPECT_TRUE(waitFor([&] { return outcome->calls > 0; })) << qPrintable(path);
        return outcome->body;
    }

    CameraSimulator m_cameras;
};

class PathReceiver : public QObject
{
    Q_OBJECT
public:
    QStringList paths;
public slots:
    void onServerDatabasePathChanged(const QString& path) { paths << path; }
};

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

// One side of a token exchange, on a clock of the test's.
struct Side
{
    std::atomic<int64_t> now{1'700'000'010}; // the first second of a 30 s step
    std::unique_ptr<Zelto::IProtectedAPIMgr> manager;

    explicit Side(const std::string& pairToken, int tolerance = 1)
    {
        Zelto::ManagerOptions options;
        options.toleranceSteps = tolerance;
        options.clock = [this]() { return now.load(); };
        manager = Zelto::CreateProtectedAPIManager(options);
        manager->SetPairToken(pairToken.data(), pairToken.size(), true);
    }
    bool accepts(const std::string& token) const { return manager->VerifyAccessToken(token); }
};

} // namespace

TEST_F(HttpCamerasTest, EveryCallEndsOnceOnTheOwnerThreadWithQtsCode)
{
    const QString w = window(1000, 1060);
    const struct
    {
        const char* camera;
        QString path;
        std::string change; // of the client or the camera for this call
        Error error;
    } rows[] = {
        {"door", w, "", QNetworkReply::NoError},
        {"door", w, "wrong password", QNetworkReply::AuthenticationRequiredError},
        {"digest", w, "", QNetworkReply::NoError},
        {"digest", w, "wrong password", QNetworkReply::AuthenticationRequiredError},
        {"tls", w, "", QNetworkReply::NoError}, // self-signed, on loopback
        {"tls", w, "verifying", QNetworkReply::SslHandshakeFailedError},
        {"door", u"/VCA/nothing/here"_s, "", QNetworkReply::ContentNotFoundError},
        {"vault", w, "", QNetworkReply::ContentAccessDenied}, // no access token
        {"yard", window(1000, 1060, u"/VCA/c1"_s), "", QNetworkReply::NoError},
        {"yard", window(1000, 1060, u"/VCA/c2"_s), "", QNetworkReply::ContentNotFoundError},
        {"door", window(1000, 1060, u"/VCA/c0"_s), "", QNetworkReply::ContentNotFoundError},
        {"door", window(1060, 1000), "", QNetworkReply::ProtocolInvalidOperationError},
        {"door", w, "failing", QNetworkReply::InternalServerError},
        {"door", w, "malformed", QNetworkReply::NoError},
        {"door", w, "small limit", QNetworkReply::UnknownContentError},
        {"door", w, "slow", QNetworkReply::TimeoutError}, // silent for longer than the limit
        {"door", w, "streaming", QNetworkReply::NoError}, // slower than the limit, never silent as long
        {"closed", w, "", QNetworkReply::ConnectionRefusedError},
        {"none", w, "", QNetworkReply::ProtocolInvalidOperationError}, // port 0
    };
    std::vector<std::unique_ptr<BraskHttpClient>> clients; // kept, so a second completion would show
    std::vector<std::shared_ptr<Outcome>> outcomes;
    for (const auto& row : rows) {
        BraskHttpClient::Options options;
        options.acceptSelfSignedOnLocalNetwork = row.change != "verifying";
        options.maxBodyBytes = row.change == "small limit" ? 1000 : options.maxBodyBytes;
        clients.push_back(std::make_unique<BraskHttpClient>(options));
        m_cameras.setFailing("door", row.change == "failing");
        m_cameras.setMalformed("door", row.change == "malformed");
        const bool slow = row.change == "slow", streaming = row.change == "streaming";
        m_cameras.setSlow("door", slow ? scaledMs(3000) : streaming ? scaledMs(100) : 0, streaming);
        m_cameras.clearServedRequests();
        const bool wrongPassword = row.change == "wrong password";
        auto out = get(*clients.back(), row.camera, row.path, wrongPassword ? u"x"_s : u"admin"_s,
                       slow        ? scaledMs(200)
                       : streaming ? scaledMs(500)
                                   : 10000);
        outcomes.push_back(out);
        ASSERT_TRUE(waitFor([&] { return out->calls > 0; }));
        // An abandoned call has no body; with a wrong password one challenge is answered, the second
        // ends the call.
        const bool abandoned = slow || row.change == "small limit", malformed = row.change == "malformed";
        EXPECT_EQ(std::tuple(out->error, out->abandoned, out->accepted,
                             out->abandoned ? out->body.isEmpty() : !objects(out->body).isEmpty(),
                             wrongPassword ? m_cameras.servedRequests().size() : 2),
                  std::tuple(row.error, abandoned, row.camera != std::string("none"),
                             abandoned || (row.error == QNetworkReply::NoError && !malformed), 2))
            << row.camera << " " << row.path.toStdString() << " " << row.change;
    }
    for (size_t i = 0; i < outcomes.size(); ++i) {
        EXPECT_TRUE(outcomes[i]->calls == 1 && outcomes[i]->thread == QThread::currentThread() &&
                    clients[i]->outstandingCount() == 0)
            << i;
    }
    QStringList local; // TLS may trust a self-signed certificate on the local network only
    for (const char* host :
         {"192.168.3.7", "172.20.0.1", "fe80::1", "LOCALHOST", "172.32.0.1", "8.8.8.8", "a.com"}) {
        local << (BraskHttpClient::isLocalNetworkHost(QLatin1String(host)) ? u"y"_s : u"n"_s);
    }
    EXPECT_EQ(local.join(QString()), u"yyyynnn"_s);
}

TEST_F(HttpCamerasTest, DestroyingTheClientCancelsRunningAndQueuedCallsAndOtherThreadsCallsEndOnItsThread)
{
    auto client = std::make_unique<BraskHttpClient>();
    std::shared_ptr<Outcome> other;
    std::thread([&] { other = get(*client, "door", window(1000, 1060)); }).join();
    ASSERT_TRUE(waitFor([&] { return other->calls > 0; }));
    EXPECT_EQ(std::pair(other->error, other->thread),
              std::pair(QNetworkReply::NoError, QThread::currentThread()));

    m_cameras.setSlow("door", scaledMs(5000));
    auto running = get(*client, "door", window(1000, 1060));
    ASSERT_TRUE(waitFor([&] { return m_cameras.servedRequests().size() == 2; }));
    auto queued = get(*client, "door", window(1000, 1060)); // not started before the client goes
    client.reset();
    for (const auto& outcome : {running, queued}) {
        EXPECT_EQ(std::tuple(outcome->calls, outcome->error, outcome->abandoned),
                  std::tuple(1, QNetworkReply::OperationCanceledError, true));
    }
}

// A closed client library calls Get through the first slot of the virtual table.
TEST(BraskHttpClient, GetIsTheFirstVirtualSlot)
{
    const auto get = &IBraskHTTPClient::Get;
    std::uintptr_t slot = 0;
    std::memcpy(&slot, &get, sizeof slot);
    EXPECT_EQ(slot, 1u); // the Itanium C++ ABI's pointer to a virtual member: 1 + its byte offset
}

TEST_F(HttpCamerasTest, AnswersHoldTheWindowsObjectsTheSameEachTimeWithAThumbnail)
{
    BraskHttpClient client;
    const qint64 from = 1'700'000'000, to = from + 180;
    const QByteArray body = fetch(client, window(from, to));
    EXPECT_EQ(fetch(client, window(from, to)), body);
    const QJsonArray list = objects(body);
    EXPECT_EQ(list.size(), m_cameras.generator().objectCount(u"hall"_s, from, to, 50));
    int inMiddleMinute = 0;
    for (int i = 0; i < list.size(); ++i) {
        const qint64 start = list[i]["StartTime"].toInteger();
        EXPECT_TRUE(start >= from && start < to && list[i]["EndTime"].toInteger() > start) << start;
        inMiddleMinute += start >= from + 60 && start < from + 120 ? 1 : 0;
        const QJsonValue thumbnail = list[i]["Thumbnail"][0];
        EXPECT_EQ(thumbnail["feature"].toArray().size(), ObjectGenerator::kFeatureLength);
        // A real 8x16 RGB PNG: its pixel data inflates to 16 rows of a filter byte and 8 pixels.
        const QByteArray png = QByteArray::fromBase64(thumbnail["image"].toString().toLatin1());
        ASSERT_TRUE(png.startsWith("\x89PNG\r\n\x1a\n"));
        const QByteArray zlib =
            QByteArray::fromHex("00000190") + png.mid(41, qFromBigEndian<quint32>(png.data() + 33));
        EXPECT_EQ(qUncompress(zlib).size(), 16 * (1 + 3 * 8));
    }
    EXPECT_EQ(objects(fetch(client, window(from + 60, from + 120))).size(), inMiddleMinute);
}

TEST(PluginHost, RefusesAMissingModuleRunsRequestsOnRequestThreadsConnectsSignalsAndRelays)
{
    QTemporaryDir data;
    QFile config(data.filePath(u"host.json"_s));
    ASSERT_TRUE(config.open(QIODevice::WriteOnly) && config.write(R"({"remoteServers": ["", "east"]})") > 0);
    config.close();
    std::atomic<int> answers{0}; // outlives the host, whose plug-ins answer on threads of their own
    PluginHost host(data.path());
    QString error;
    EXPECT_FALSE(host.load(data.filePath(u"no.so"_s), &error) || host.plugin());
    EXPECT_TRUE(error.contains(u"not found"_s)) << qPrintable(error);
    ASSERT_TRUE(host.load(PLUGIN_MODULE_PATH, &error)) << qPrintable(error);
    EXPECT_EQ(host.plugin()->thread(), QThread::currentThread());
    // The store finds its installation directory, the data folder, through the settings.
    EXPECT_EQ(host.serverInfo().serverDatabasePath(), QDir(data.path()).filePath(u"database"_s));
    QSettings settings(QSettings::NativeFormat, QSettings::SystemScope, u"Quorvex, Inc."_s, u"NOVIR"_s);
    EXPECT_EQ(settings.value(u"Software/INSTALL_PATH"_s).toString(), QDir(data.path()).absolutePath());

    QMutex mutex;
    QList<QThread*> threads; // guarded by mutex: one per reply
    for (int i = 0; i < 40; ++i) {
        host.request(u"noSuchCommand"_s, QVariant(i), RequestSenderInfo{},
                     [&](bool final, const QString& code, const QString&, const QVariant&) {
                         EXPECT_TRUE(final && code == u"commandNotSupportError"_s) << qPrintable(code);
                         QMutexLocker lock(&mutex);
                         threads << QThread::currentThread();
                     });
    }
    host.waitForRequests();
    EXPECT_TRUE(threads.size() == 40 && !threads.contains(QThread::currentThread())); // all replies are in
    host.unload();
    EXPECT_EQ(host.plugin(), nullptr);

    // The manager connects the host's own plug-ins' signals; the relay reaches the servers in host.json.
    const QString serverInfo = u"3CE573D25E0F455B8F75EDDC573E2B64"_s,
                  bookmarks = u"2F6394EE90434A7190D7511370AFAE17"_s;
    const char* signal = "2serverDatabasePathChanged(const QString &)";
    const char* slot = "1onServerDatabasePathChanged(const QString &)";
    PathReceiver receiver;
    IPluginManager* manager = host.GetPluginManager();
    EXPECT_NE(manager->GetPluginObject(serverInfo), nullptr);
    EXPECT_TRUE(manager->ConnectPluginSignal(serverInfo, signal, &receiver, slot, 0));
    host.serverInfo().setServerDatabasePath(u"/elsewhere"_s);
    host.serverInfo().setServerDatabasePath(u"/elsewhere"_s); // unchanged: no signal
    EXPECT_EQ(receiver.paths, QStringList{u"/elsewhere"_s});

    EXPECT_EQ(host.remoteBookmarkPlugin(QString()), nullptr); // an empty name names no server
    ASSERT_NE(host.remoteBookmarkPlugin(u"east"_s), nullptr);
    const auto answer = [&](bool success, QVariant, QString code, QString, bool final) {
        answers += success && final && code == u"0"_s ? 1 : 100; // 1 per answer that says stored
    };
    const QVariantMap bookmark{{u"CameraID"_s, u"cam-1"_s}};
    IRelaySender* relay = host.GetRelaySender();
    EXPECT_FALSE(relay->RelayRequest(bookmarks, u"AddBookmark"_s, bookmark, false, u"west"_s, answer));
    EXPECT_TRUE(relay->RelayRequest(bookmarks, u"AddBookmark"_s, bookmark, false, u"east"_s, answer));
    ASSERT_TRUE(waitFor([&] { return answers > 0; }));
    EXPECT_EQ(answers, 1);
    EXPECT_EQ(host.remoteBookmarkPlugin(u"east"_s)->bookmarks().size(), 1);
    EXPECT_TRUE(host.bookmarkPlugin().bookmarks().isEmpty());
}

// The journal: adds and deletes survive a restart, a line torn by a crash is dropped, and a file
// in the older form (every bookmark by id) still loads.
TEST(BookmarkPlugin, ChangesSurviveARestartATornLineAndTheOlderForm)
{
    QTemporaryDir data;
    const QString path = data.filePath(u"b/bookmarks.json"_s);
    const auto call = [](BookmarkPlugin& plugin, const char* method, const QVariantMap& request) {
        QString id;
        std::atomic<bool> done{false};
        QMetaObject::invokeMethod(
            &plugin, method, Q_ARG(QVariant, request), Q_ARG(RequestSenderInfo, {}),
            Q_ARG(HDLR_DO_REQUEST_CB, [&](bool, QString code, QString, QVariant payload) {
                id = code + payload.toMap().value(u"BookmarkID"_s).toString();
                done = true;
            }));
        EXPECT_TRUE(waitFor([&] { return done.load(); }));
        return id;
    };
    const auto ids = [&]() { return QStringList(BookmarkPlugin(path).bookmarks().keys()).join(u','); };
    QString kept;
    {
        BookmarkPlugin plugin(path);
        kept = call(plugin, "AddBookmark", {{u"CameraID"_s, u"cam-1"_s}}).mid(1);
        const QString gone = call(plugin, "AddBookmark", {{u"CameraID"_s, u"cam-2"_s}}).mid(1);
        EXPECT_EQ(call(plugin, "DeleteBookmark", {{u"BookmarkID"_s, gone}}), u"0"_s);
    }
    QFile file(path);
    ASSERT_TRUE(file.open(QIODevice::Append) && file.write("{\"add\":{\"BookmarkID\":\"torn\",\"Came") > 0);
    file.close();
    EXPECT_EQ(ids(), kept);
    EXPECT_EQ(ids(), kept); // the rewritten journal reads the same
    ASSERT_TRUE(file.open(QIODevice::WriteOnly) && file.write("{\"old\": {\"BookmarkID\": \"old\"}}") > 0);
    file.close();
    EXPECT_EQ(ids(), u"old"_s);
}

TEST(NovirSite, SiteFilesAreReadBadOnesLeaveTheSiteAloneAndTheirWordsDriveTheCameras)
{
    NovirSite site;
    QString error;
    ASSERT_TRUE(NovirSite::fromJson(
        R"({"serverId":"s9","partSize":2,"cameras":[{"name":"A","port":1234,"useSSL":true,"httpsPort":4443,
        "password":"pw","protected":true,"channels":3,"channel":2,"location":"Loc5","groupId":4,"live":false,
        "online":false}]})",
        &site, &error))
        << qPrintable(error);
    const NovirCamera a = site.cameras.value(0);
    EXPECT_EQ(std::tuple(site.cameras.size(), site.serverId, site.partSize, a.port, a.useSsl, a.httpsPort,
                         a.password, a.protectCap, a.channelCount, a.channel, a.location, a.groupId, a.live,
                         a.online),
              std::tuple(1, u"s9"_s, 2, 1234, true, 4443, u"pw"_s, true, 3, 2, u"Loc5"_s, 4, false, false));
    for (const char* json :
         {"[]", R"({"cameras":[{"port":80}]})", R"({"cameras":[{"name":"A","port":70000}]})",
          R"({"cameras":[{"name":"A"},{"name":"A"}]})", R"({"partSize":0,"cameras":[]})",
          R"({"vocabulary":{"Hat":["x"]},"cameras":[]})", R"({"vocabulary":{"Type":[]},"cameras":[]})",
          R"({"vocabulary":{"Type":["car",""]},"cameras":[]})", R"({"vocabulary":[],"cameras":[]})"}) {
        EXPECT_FALSE(NovirSite::fromJson(json, &site, &error) || site.serverId != u"s9"_s) << json;
    }
    NovirCamera odd; // texts are escaped
    odd.name = u"A<&>B"_s, odd.location = u"Loc1"_s;
    EXPECT_EQ(valuesAt(NovirSite::nodeInfoXml({odd}), u"NodeInfo/Cameras/Cam/Name"_s) +
                  valuesAt(NovirSite::locationsXml({odd}), u"LocRecs/LocList/Loc/Alias"_s),
              (QStringList{odd.name, odd.name}));

    // A site's own words replace the built-in ones attribute by attribute, and its cameras then make
    // only codes those words cover (and ages that are its words, quotes and all).
    ASSERT_TRUE(NovirSite::fromJson(
        R"({"cameras":[],"vocabulary":{"Type":["car","lorry","tractor"],"Age":["kid","\"old\""]}})", &site,
        &error))
        << qPrintable(error);
    const AttributeVocabulary& words = site.vocabulary;
    EXPECT_EQ(std::tuple(words.describe(u"Type"_s, 1), words.describe(u"Color"_s, QVariantList{0, 9}),
                         words.describe(u"Gender"_s, 7), words.describe(u"Age"_s, u"kid"_s)),
              std::tuple(u"lorry"_s, u"black/brown"_s, u"code 7"_s, u"kid"_s));
    const ObjectGenerator generator(3, 5, 5, words);
    const QJsonArray list = objects(generator.answer(u"cam"_s, 1'700'000'000, 1'700'000'600, 60));
    QSet<int> types;
    QSet<QString> ages;
    for (const QJsonValue& object : list) {
        const QJsonObject attributes = object["Attributes"].toObject();
        if (attributes.contains(u"Type"_s)) {
            types.insert(attributes["Type"].toInt());
        } else {
            ages.insert(attributes["Age"].toString());
        }
    }
    EXPECT_TRUE(!types.isEmpty() && (QSet<int>{0, 1, 2}.contains(types))) << types.size();
    EXPECT_EQ(ages, (QSet<QString>{u"kid"_s, u"\"old\""_s}));
}

TEST(NovirServer, AnswersComeInPartsFromTheServerThreadAndADownServerTakesNoRequest)
{
    Calls calls; // outlives the server, which calls back until its thread stops
    NovirSite site = NovirSite::defaultSite();
    site.partSize = 3;
    NovirConfigServer server(site);
    const QString plugin = u"test-plugin"_s;
    server.registerConnectStatusHandler(
        plugin, NSNovirTunnelClient::ConnectStatus,
        [&](Qt::HANDLE, NSNovirTunnelClient::ServerType type, bool up) {
            calls.add(u"connect:%1=%2"_s.arg(int(type)).arg(up));
        },
        QString());
    server.start();
    ASSERT_TRUE(waitFor([&] { return calls.has(u"connect:4=1"_s); }));
    // Sends a request and gives the log and texts of its parts.
    const auto ask = [&](const QString& cmd, const QString& content, NSNovirTunnelClient::ServerType type) {
        calls.log.clear(), calls.texts.clear(); // the server is idle between requests
        NSNovirTunnelClient::RequestInfo request{0, 15000, content, {}, {}};
        request.respCB = [&](bool success, const QString& cmd, const QString&, const QString& retCode,
                             const QString& text, bool finish) {
            calls.add(u"%1:%2:%3:%4"_s.arg(cmd).arg(success).arg(retCode).arg(finish), text);
        };
        EXPECT_TRUE(server.insertRequest(plugin, server.getServerAccountID(), type, cmd, request));
        server.flush();
        return std::pair(calls.log.join(u' '), calls.texts);
    };
    QStringList names, expected;
    for (const NovirCamera& camera : site.cameras) {
        expected << camera.name << (camera.location.isEmpty() ? QStringList() : QStringList{camera.name});
    }
    const auto [nodes, nodeTexts] =
        ask(u"GetNodeInfo"_s, u"<GetNodeInfo><Node>__allcams__</Node></GetNodeInfo>"_s, ConfigServer);
    const auto [locations, locationTexts] =
        ask(u"QryLocs"_s, u"<QryLocs><LiveOnly>false</LiveOnly></QryLocs>"_s, LocationServer);
    EXPECT_EQ(nodes + u" "_s + locations,
              u"GetNodeInfo:1:0:0 GetNodeInfo:1:0:0 GetNodeInfo:1:0:1 "
              "QryLocs:1:0:0 QryLocs:1:0:0 QryLocs:1:0:1"_s); // 8 cameras, 3 a part
    for (int i = 0; i < 3; ++i) {
        names += valuesAt(nodeTexts.value(i), u"NodeInfo/Cameras/Cam/Name"_s) +
                 valuesAt(locationTexts.value(i), u"LocRecs/LocList/Loc/Alias"_s);
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
    EXPECT_FALSE(server.insertRequest(plugin, nullptr, LocationServer, u"QryLocs"_s, {}));
}

TEST(Quellon, ElementsBecomeMapsRepeatedOnesListsAndLeavesTheirText)
{
    const QString plate = u"京A·12345 Ä ß"_s;
    const QString xml =
        u"<?xml version=\"1.0\"?>\n<R attr=\"ignored\">\n <B><C>x</C><D>7</D></B>\n"
        " <I>1</I><J>only</J><I>2</I><I><K>3</K></I>\n <Empty/><Open></Open>\n"
        " <Text>a &amp; b &lt;c&gt; &#x41;</Text> <!-- comment -->\n"
        " <Data><![CDATA[<raw & text>]]></Data><Spaces>\n  trimmed \t</Spaces><P>%1</P>\n</R>\n"_s.arg(plate);
    EXPECT_EQ(
        QJsonDocument::fromVariant(Quellon().parse(xml)).toJson(QJsonDocument::Compact),
        QString(uR"({"R":{"B":{"C":"x","D":"7"},"Data":"<raw & text>","Empty":"","I":["1","2",{"K":"3"}],)"
                uR"("J":"only","Open":"","P":"%1","Spaces":"trimmed","Text":"a & b <c> A"}})"_s.arg(plate))
            .toUtf8());
    // Past 16 names the children are found by hash; repeated names still gather in one list.
    QString many = u"<R>"_s;
    QVariantMap expected;
    for (int i = 0; i < 120; ++i) { // all 40 names once, then the even ones twice more
        many += i < 40 || i % 2 == 0 ? u"<N%1>%2</N%1>"_s.arg(i % 40).arg(i / 40) : QString();
        expected[u"N%1"_s.arg(i % 40)] =
            i % 2 ? QVariant(u"0"_s) : QVariant(QVariantList{u"0"_s, u"1"_s, u"2"_s});
    }
    EXPECT_EQ(Quellon().parse(many + u"</R>"_s).toMap().value(u"R"_s), QVariant(expected));
}

TEST(Quellon, MalformedOrHostileInputIsRefusedAndLimitsHold)
{
    const auto nested = [](int depth) {
        return u"<a>"_s.repeated(depth) + u"x"_s + u"</a>"_s.repeated(depth);
    };
    QString laughs = u"<?xml version=\"1.0\"?><!DOCTYPE l [<!ENTITY l0 \"ha\">"_s;
    for (int i = 1; i < 10; ++i) {
        laughs += u"<!ENTITY l%1 \"%2\">"_s.arg(i).arg(u"&l%1;"_s.arg(i - 1).repeated(10));
    }
    QStringList refused =
        u"|plain text|<A><B>x</B>|<A><B>x</A></B>|<A></A><B></B>|<A>x</A>trailing|<A x=1></A>|"
        "<A>&bogus;</A>|<A>\x01</A>|<!DOCTYPE r><r>x</r>"_s.split(u'|');
    refused << laughs + u"]><l>&l9;</l>"_s << nested(Quellon::kMaxDepth + 1) << nested(200000)
            << u"<?xml version=\"1.0\"?><!DOCTYPE r [<!ENTITY x SYSTEM \"file:///etc/passwd\">]><r>&x;</r>"_s
            << u"<r>"_s + u"<e/>"_s.repeated(Quellon::kMaxElements + 1) + u"</r>"_s;
    for (const QString& xml : refused) {
        EXPECT_FALSE(Quellon().parse(xml).isValid()) << qPrintable(xml.left(120));
    }
    EXPECT_TRUE(Quellon().parse(nested(Quellon::kMaxDepth)).isValid());
    const QString big(8 * 1024 * 1024, u'z'); // a huge text is just a text
    EXPECT_EQ(Quellon().parse(u"<T>"_s + big + u"</T>"_s).toMap().value(u"T"_s).toString().size(),
              big.size());
}

TEST(Zelto, TokensAreFreshAndAcceptedOnlyWithTheSamePairTokenSecretAndClock)
{
    const std::string pairToken = Zelto::GeneratePairToken();
    const auto urlSafe = [](const std::string& text) {
        return std::regex_match(text, std::regex("[A-Za-z0-9_-]+"));
    };
    EXPECT_TRUE(urlSafe(pairToken) && pairToken != Zelto::GeneratePairToken()) << pairToken;
    Side client(pairToken), camera(pairToken), otherPair(Zelto::GeneratePairToken());
    std::set<std::string> seen;
    for (int i = 0; i < 20; ++i) { // each token new, and accepted
        const std::string token = client.manager->GetAccessToken();
        EXPECT_TRUE(urlSafe(token) && camera.accepts(token) && seen.insert(token).second) << token;
    }
    const std::string token = client.manager->GetAccessToken();
    EXPECT_FALSE(otherPair.accepts(token) || camera.accepts(std::string()) || camera.accepts("not a token"));
    // Changed data bits (not the last character, which may carry only padding bits).
    for (size_t i : {size_t(0), token.size() / 2, token.size() - 2}) {
        std::string tampered = token;
        tampered[i] = tampered[i] == 'A' ? 'B' : 'A';
        EXPECT_FALSE(camera.accepts(tampered)) << i;
    }
    // Another spelling of the same bytes (a spare bit of the last character) is not the token.
    const std::string alphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-_";
    EXPECT_FALSE(
        camera.accepts(token.substr(0, token.size() - 1) + alphabet[alphabet.find(token.back()) ^ 1]));
    EXPECT_EQ(Side(std::string()).manager->GetAccessToken(), std::string()); // no pair token, no token

    const int clocks[][3] = {{1, 45, 1}, {1, -25, 1}, {1, 90, 0}, {1, -70, 0}, {0, 5, 1}, {0, 35, 0}};
    for (const auto& [steps, ahead, accepted] : clocks) { // tolerance steps, camera clock ahead by
        Side late(pairToken, steps);
        late.now = client.now + ahead;
        EXPECT_EQ(late.accepts(token), bool(accepted)) << steps << " " << ahead;
    }

    // The site's secret is mixed in as well.
    auto withSecret = Zelto::CreateProtectedAPIManager("site", 4, true),
         sameSecret = Zelto::CreateProtectedAPIManager("site", 4, true),
         noSecret = Zelto::CreateProtectedAPIManager("", 0, true);
    for (auto* m : {withSecret.get(), sameSecret.get(), noSecret.get()}) {
        m->SetPairToken(pairToken.data(), pairToken.size(), true);
    }
    const std::string sealed = withSecret->GetAccessToken();
    EXPECT_TRUE(sameSecret->VerifyAccessToken(sealed) && !noSecret->VerifyAccessToken(sealed));
}

// The log library reads its settings once per process: the lines are written in a fresh one.
TEST(WemloLogUtl, DISABLED_WritesInAFreshProcess)
{
    QTemporaryDir dir;
    const QByteArray path = dir.filePath(u"log.txt"_s).toLocal8Bit();
    setenv("WEMLO_LOG_FILE", path.constData(), 1);
    void* library = dlopen(WEMLO_LIBRARY_PATH, RTLD_NOW | RTLD_LOCAL);
    ASSERT_NE(library, nullptr) << dlerror();
    WemloLogObject* log = nullptr;
    reinterpret_cast<LogTrace_GetGlobalObjectFn>(dlsym(library, "LogTrace_GetGlobalObject"))(0, &log);
    int id = 0;
    log->registerModule(log->context, 0, "Cams", &id);
    for (int module : {id, 0, id + 5}) {
        ASSERT_EQ(log->check(log->context, (module << 8) | 2, 0, __FILE__, __LINE__), 0);
        [log](const char* format, ...) {
            va_list args;
            va_start(args, format);
            log->write(log->context, format, args);
            va_end(args);
        }("line %d", module);
    }
    QFile file(QString::fromLocal8Bit(path));
    const std::string text = file.open(QIODevice::ReadOnly) ? file.readAll().toStdString() : "";
    EXPECT_TRUE(
        std::regex_match(text, std::regex("[^\n]* ERROR Cams [^\n]* line 1\n[^\n]* ERROR - [^\n]* line 0\n"
                                          "[^\n]* ERROR - [^\n]* line 6\n")))
        << text;
}

TEST(WemloLogUtl, WritesLinesOfUnknownModulesWithoutAName)
{
    runDisabledTestInChild("WemloLogUtl.DISABLED_WritesInAFreshProcess");
}

#include "PiecesTest.moc"
