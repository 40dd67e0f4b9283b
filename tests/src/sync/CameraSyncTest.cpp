// Camera metadata synchronisation. The proxy over a recording HTTP client (composed paths, the
// per-camera queue and its drop rule, answers and failures, the pair-token exchange); the
// synchroniser with a recording proxy and a simulated clock (windows of a pass, last-sync rules,
// enable switch, pair and access tokens, client-requested windows, settings files); its wiring into
// the plug-in; and end to end over loopback against simulated cameras.
#include "BraskHttpClient.h"
#include "CameraSimulator.h"
#include "CameraSynchronizer.h"
#include "DelvixKeys.h"
#include "HostFakes.h"
#include "PluginDelvixSrv.h"
#include "ReplyRecorder.h"
#include "TestWait.h"

#include <QDateTime>
#include <QDir>
#include <QSignalSpy>
#include <QTemporaryDir>
#include <QThread>
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

using namespace Qt::StringLiterals;

namespace {

constexpr qint64 T = 1'700'000'000;

// Records what the synchroniser asks for instead of sending it.
class RecordingProxy : public CameraProxy
{
public:
    RecordingProxy()
        : CameraProxy(std::make_shared<RecordingHttpClient>())
    {}
    void sendRequest(QVariantMap& request, bool dropCovered) override
    {
        requests.append(request);
        EXPECT_EQ(dropCovered, !clientRequested); // a window the client asked for is never dropped
        EXPECT_EQ(QThread::currentThread(), qApp->thread());
    }
    void sendPairTokenRequest(const QVariantMap& record) override { tokenRequests.append(record); }
    // The windows asked for a camera as "count first-start..last-end" against T, "0" for none.
    QString span(const QString& camera) const
    {
        qint64 count = 0, first = 0, last = 0;
        for (const QVariantMap& r : requests) {
            if (r.value("cameraID") == camera) {
                first = count++ ? first : r.value("startTimestamp").toLongLong() - T;
                last = r.value("endTimestamp").toLongLong() - T;
            }
        }
        return count ? u"%1 %2..%3"_s.arg(count).arg(first).arg(last) : u"0"_s;
    }

    bool clientRequested = false;
    QList<QVariantMap> requests;
    QList<QVariantMap> tokenRequests;
};

QVariantMap record(const QString& name, bool protect = false, const QString& location = "Loc3")
{
    return QVariantMap{
        {"Name", name},       {"IP", "127.0.0.1"}, {"Port", "8000"},           {"User", "admin"},
        {"Password", "6162"}, {"UseSSL", false},   {"DelvixProtect", protect}, {"Location", location},
        {"GroupID", 2}};
}

// The settings files are read from the working directory: each test runs in an empty one.
class CameraSynchronizerTest : public ::testing::Test
{
protected:
    void SetUp() override { QDir::setCurrent(dir.path()); }
    void TearDown() override
    {
        sync.reset();
        QDir::setCurrent(previousDir);
    }
    CameraSynchronizer& make()
    {
        proxy = std::make_shared<RecordingProxy>();
        sync = std::make_unique<CameraSynchronizer>(proxy, [this] { return nowMs.load(); });
        return *sync;
    }

    QTemporaryDir dir;
    const QString previousDir = QDir::currentPath();
    std::atomic<qint64> nowMs{T * 1000 + 999}; // the milliseconds are cut off
    std::shared_ptr<RecordingProxy> proxy;
    std::unique_ptr<CameraSynchronizer> sync;
};

QString metaPath(qint64 start, qint64 end)
{
    return QStringLiteral("/VCA/Data/DB/ObjectMeta?StartTime=%1&EndTime=%2&Info=127").arg(start).arg(end);
}

struct CameraProxyTest : ::testing::Test
{
    QString send(const QString& camera, qint64 start, qint64 end, bool dropCovered = true,
                 QVariantMap extra = {})
    {
        QVariantMap request{{"cameraID", camera}, {"startTimestamp", start}, {"endTimestamp", end}};
        request.insert(
            QVariantMap{{"ip", "127.0.0.1"}, {"port", 8080}, {"username", "admin"}, {"useSSL", false}});
        request.insert("password", "61646d696e");
        request.insert(extra);
        proxy->sendRequest(request, dropCovered);
        return request.value("path").toString();
    }
    std::shared_ptr<RecordingHttpClient> client = std::make_shared<RecordingHttpClient>();
    std::unique_ptr<CameraProxy> proxy = std::make_unique<CameraProxy>(client);
};

} // namespace

TEST_F(CameraSynchronizerTest, WindowsOfAPassFollowTheLastSyncTime)
{
    QVariantMap cameras;
    for (const char* name : {"fresh", "behind", "far", "recent", "future"}) {
        cameras.insert(name, record(name));
    }
    make().updateInformation(cameras);
    QVariantMap lastSync{{"behind", uint(T - 600)}, {"far", uint(T - 7200)}, {"recent", uint(T - 180)}};
    lastSync.insert("future", uint(T + 500));
    sync->updateLastSync(lastSync);
    sync->synchronize();
    // "count first-start..last-end" against the present; at most an hour's worth per pass.
    QStringList spans;
    for (const char* camera : {"fresh", "behind", "far", "recent", "future"}) {
        spans << proxy->span(camera);
    }
    EXPECT_EQ(spans, (QStringList{"1 -240..-180", "7 -600..-180", "60 -7200..-3600", "0", "0"}));
}

TEST_F(CameraSynchronizerTest, LastSyncNeverMovesBackAndCamerasThatLeftAreIgnored)
{
    make().updateInformation({{"a", record("a")}});
    QSignalSpy forwarded(sync.get(), &CameraSynchronizer::receiveResponseData);
    const QVariantMap data{{"data", QByteArray("{}")}, {"count", 2}};
    QList<uint> seen;
    // 0: set back by hand; older windows are still forwarded; times compare unsigned.
    for (uint end : {500u, 400u, 0u, 7u, 0xF0000000u}) {
        end ? sync->receiveObjectMeta("a", end, data) : sync->updateLastSync({{"a", 0u}});
        seen << sync->getLastSyncMap().value("a").toUInt();
    }
    EXPECT_EQ(seen, (QList<uint>{500u, 500u, 0u, 7u, 0xF0000000u}));
    EXPECT_EQ(forwarded[1], (QList<QVariant>{record("a"), 400u, data}));
    sync->receiveObjectMeta("gone", 900, data);
    EXPECT_EQ(forwarded.size(), 4); // a camera that left: neither forwarded nor kept

    // Disabled: last sync forgotten, nothing sent, not even on request; enabled again it starts afresh.
    sync->updateLastSync({{"a", uint(T - 600)}});
    for (const QVariantMap& settings : {QVariantMap{{"enable", false}}, QVariantMap{}}) {
        sync->setEnableDelvix(settings);
        sync->synchronize();
        sync->retrieveDelvixData("a", T - 1000, T - 900);
        QCoreApplication::processEvents();
        EXPECT_TRUE(sync->getLastSyncMap().isEmpty() && proxy->requests.isEmpty());
    }
    sync->setEnableDelvix({{"enable", true}});
    sync->synchronize();
    EXPECT_EQ(proxy->span("a"), "1 -240..-180");
}

TEST_F(CameraSynchronizerTest, ProtectedCamerasAreAskedForPairTokensAndFetchedWithAccessTokens)
{
    const QVariantMap cameras{{"open", record("open")}, {"vault", record("vault", true)}};
    make().updateInformation(cameras);
    ASSERT_EQ(proxy->tokenRequests, QList<QVariantMap>{record("vault", true)});
    sync->updateInformation(cameras); // equal: nothing
    sync->synchronize();              // still no token: asked again, and fetched unprotected meanwhile
    EXPECT_EQ(proxy->tokenRequests.size(), 2);
    EXPECT_EQ(proxy->requests.last().value("accessToken").toString(), QString());

    const std::string pairToken = Zelto::GeneratePairToken();
    sync->receivePairToken("vault", QString::fromStdString(pairToken));
    nowMs += 60'000;
    sync->synchronize();
    EXPECT_EQ(proxy->tokenRequests.size(), 2);
    EXPECT_TRUE(proxy->requests.end()[-2].value("accessToken").toString().isEmpty()); // open
    auto camera = Zelto::CreateProtectedAPIManager("", 0, true);
    camera->SetPairToken(pairToken.data(), pairToken.size(), true);
    EXPECT_TRUE(
        camera->VerifyAccessToken(proxy->requests.last().value("accessToken").toString().toStdString()));

    QVariantMap changed = cameras;
    changed.insert("other", record("other", true));
    sync->updateInformation(changed); // any change forgets every token and asks every protected camera
    EXPECT_EQ(proxy->tokenRequests.size(), 4);
    sync->synchronize();
    EXPECT_EQ(proxy->tokenRequests.size(), 6);
}

TEST_F(CameraSynchronizerTest, ClientRequestedWindowIsOneRequestOnTheOwnerThread)
{
    QVariantMap channel = record("yard-c0");
    channel.insert("MultiChannelID", 0);
    make().updateInformation({{"yard-c0", channel}});
    proxy->clientRequested = true;
    sync->retrieveDelvixData("nobody", T - 9000, T - 100);
    std::thread([&] { sync->retrieveDelvixData("yard-c0", T - 9000, T - 100); }).join();
    EXPECT_TRUE(proxy->requests.isEmpty()); // not on the host's thread
    QCoreApplication::processEvents();
    EXPECT_EQ(proxy->span("yard-c0"), "1 -9000..-100");
    EXPECT_EQ(proxy->requests.size(), 1);
    EXPECT_EQ(proxy->requests[0].value("multiChannelID").toInt(), 0);

    // A call still on its way when the synchroniser goes is dropped, not run on a dead object.
    std::thread([&] { sync->retrieveDelvixData("yard-c0", T - 50, T); }).join();
    sync.reset();
    QCoreApplication::processEvents();
    EXPECT_EQ(proxy->requests.size(), 1);
}

TEST_F(CameraSynchronizerTest, SettingsFiles)
{
    // routineSyncTimeBuffer.txt, getObjectDataTimeBuffer.txt (null: absent), "period delay". Periods
    // that would spin the timer or overflow its interval fall back to 60 s, as does a file whose last
    // line is empty; not a number reads as 0, which is a usable delay.
    const char* rows[][3] = {
        {nullptr, nullptr, "60 180"},  {"10\n30\n", "120", "30 120"}, {"0", nullptr, "60 180"},
        {"-5", nullptr, "60 180"},     {"sixty", nullptr, "60 180"},  {"3000000", nullptr, "60 180"},
        {"60\n\n", nullptr, "60 180"}, {nullptr, "later", "60 0"},    {nullptr, "4000000000", "60 180"}};
    for (const auto& [period, delay, expected] : rows) {
        int i = 0;
        for (const char* content : {period, delay}) {
            QFile file(dir.filePath(i++ ? "getObjectDataTimeBuffer.txt" : "routineSyncTimeBuffer.txt"));
            file.remove();
            ASSERT_TRUE(!content || (file.open(QIODevice::WriteOnly) && file.write(content) >= 0));
        }
        make().updateInformation({{"a", record("a")}});
        const int p = sync->routineSyncPeriodSecond();
        const qint64 d = sync->delayGetObjectDataSecond();
        EXPECT_EQ(u"%1 %2"_s.arg(p).arg(d), QString::fromUtf8(expected)) << period << " " << delay;
        EXPECT_EQ(sync->timerIntervalMs(), p * 1000);
        sync->synchronize();
        EXPECT_EQ(proxy->span("a"), u"1 %1..%2"_s.arg(-d - p).arg(-d)) << period << " " << delay;
    }
}

// The plug-in's side: directory signals reach the installed synchroniser, fetched metadata with
// objects reaches the directory's writeData, and "retrieveDelvixData" from a host thread runs on the
// plug-in's thread without a reply.
TEST_F(CameraSynchronizerTest, PluginWiresTheDirectoryTheSynchronizerAndTheCollector)
{
    auto client = std::make_shared<RecordingHttpClient>();
    PluginDelvixSrv plugin;
    auto owned = QSharedPointer<CameraSynchronizer>::create(std::make_shared<CameraProxy>(client));
    auto* collector = new FakeCollector; // owned by the plug-in
    plugin.setCameraSynchronizer(owned);
    plugin.setCameraInformationCollector(QSharedPointer<ICameraInformationCollector>(collector));
    ASSERT_TRUE(plugin.InitialPluginBase(nullptr));
    emit collector->cameraInformationChanged({{"a", record("a", false, "Loc12")},
                                              {"b", record("b", false, "12")},
                                              {"c", record("c", false, "Locab")},
                                              {"d", record("d", false, "Loc5")}});

    // Metadata with objects of a known camera is written with the group and the location number.
    const QVariantMap some{{"data", QByteArray("{\"ObjectMetaInfo\":[{\"ID\":1}]}")}, {"count", 1}};
    for (const char* camera : {"a", "b", "c"}) {
        owned->receiveObjectMeta(camera, 10, some);
    }
    owned->receiveObjectMeta("d", 10, {{"data", QByteArray("{\"ObjectMetaInfo\":[]}")}, {"count", 0}});
    owned->receiveObjectMeta("d", 11, {{"data", QByteArray("{}")}});
    const QString written = "2/%1 {\"ObjectMetaInfo\":[{\"ID\":1}]}";
    EXPECT_EQ(collector->writes(), (QStringList{written.arg(12), written.arg(12), written.arg(0)}));

    // Cameras that lose their location or go offline are forgotten; disabling forgets them all.
    emit collector->locationRemoved("a");
    emit collector->cameraDisconnected("b");
    EXPECT_EQ(owned->getLastSyncMap().keys(), (QStringList{"c", "d"}));
    plugin.setEnableDelvix({{"enable", false}, {"faceEnable", true}});
    owned->synchronize();
    EXPECT_TRUE(owned->getLastSyncMap().isEmpty() && collector->settings().value("faceEnable").toBool());
    plugin.setEnableDelvix({{"enable", true}});

    ReplyRecorder replies;
    std::thread([&] {
        plugin.Request(
            CMD_RETRIEVE_DELVIX_DATA,
            QVariantMap{{KEY_NODE_ID, "a"}, {KEY_START_TIMESTAMP, 1000}, {KEY_END_TIMESTAMP, 5000}},
            RequestSenderInfo(), replies.callback());
    }).join();
    EXPECT_TRUE(client->calls.isEmpty());
    EXPECT_TRUE(waitFor([&] { return !client->calls.isEmpty(); }));
    EXPECT_EQ(client->paths, QStringList{"/VCA/Data/DB/ObjectMeta?StartTime=1000&EndTime=5000&Info=127"});
    EXPECT_TRUE(replies.replies().empty());
}

// Simulated cameras (plain, protected, multi-channel, failing, slow), the real HTTP client, the proxy
// and the synchroniser on this thread's event loop.
TEST_F(CameraSynchronizerTest, EndToEndEveryHealthyCameraIsFetchedWhateverTheOthersDo)
{
    // name, port, user, password, protected, channels, SSL, digest, objects per minute
    const QList<CameraSetup> setups{{"door", 0, "admin", "pa:ss", false, 1, false, false, 20},
                                    {"vault", 0, "admin", "pa:ss", true, 1, true, false, 20},
                                    {"yard", 0, "admin", "pa:ss", false, 2, false, true, 20},
                                    {"broken", 0, "admin", "pa:ss", false, 1, false, false, 20},
                                    {"sluggish", 0, "admin", "pa:ss", false, 1, false, false, 20}};
    CameraSimulator cameras;
    ASSERT_TRUE(cameras.start(setups));
    cameras.setFailing("broken", true);
    cameras.setSlow("sluggish", 60000); // far slower than the test: it can only hold others up

    auto proxy = std::make_shared<CameraProxy>(std::make_shared<BraskHttpClient>());
    proxy->setRequestTimeoutMs(120000);
    CameraSynchronizer sync(proxy);
    QSignalSpy tokens(proxy.get(), &CameraProxy::receivePairToken);
    QSignalSpy failures(proxy.get(), &CameraProxy::requestFailed);
    QSignalSpy answers(&sync, &CameraSynchronizer::receiveResponseData);
    sync.updateInformation(cameras.directoryMap());
    ASSERT_TRUE(waitFor([&] { return tokens.size() == 1; }));
    const qint64 now = QDateTime::currentSecsSinceEpoch();
    sync.synchronize();

    // The four healthy sources answer while the slow camera is still thinking (the protected one
    // lets in only requests with an access token).
    ASSERT_TRUE(waitFor([&] { return answers.size() >= 4 && failures.size() >= 1; }));
    EXPECT_EQ(failures, QList<QList<QVariant>>{{"broken"}});
    // "name, whether the window ends where it should and is the camera's last sync, objects missing".
    QStringList answered;
    for (const QList<QVariant>& answer : answers) {
        const QString name = answer[0].toMap().value("Name").toString();
        const qint64 end = answer[1].toUInt();
        const int count =
            cameras.generator().objectCount(QString(name).replace(u'-', u'/'), end - 60, end, 20);
        const bool fresh = end >= now - 180 && end <= now - 175 && sync.getLastSyncMap().value(name) == end;
        answered << u"%1 %2 %3"_s.arg(name).arg(fresh).arg(count - answer[2].toMap().value("count").toInt());
    }
    answered.sort();
    EXPECT_EQ(answered, (QStringList{"door 1 0", "vault 1 0", "yard-c0 1 0", "yard-c1 1 0"}));
    EXPECT_EQ(sync.getLastSyncMap().size(), 4); // neither the failing nor the slow camera
}

TEST_F(CameraProxyTest, ComposedPathsAndCredentials)
{
    const QString query = QStringLiteral("StartTime=100&EndTime=160&Info=127");
    const std::vector<std::pair<QVariantMap, QString>> rows{
        // Characters that mean something in a query cannot leak out of the token.
        {{{"accessToken", "a+b/c=&StartTime=0 %"}, {"multiChannelID", "0"}, {"useSSL", true}},
         "admin:admin@127.0.0.1:8080 ssl "
         "/VCA/c0/Data/DB/ObjMeta?accessToken=a%2Bb%2Fc%3D%26StartTime%3D0%20%25&" +
             query},
        // Hexadecimal Latin-1 password: non-hex characters are skipped, bytes above 127 survive.
        {{{"password", "61:64-6dzE9"}},
         QString::fromLatin1("admin:adm\xe9@127.0.0.1:8080 /VCA/Data/DB/ObjectMeta?") + query},
    };
    for (const auto& [extra, expected] : rows) {
        const QString path = send(QString::number(client->calls.size()), 100, 160, true, extra);
        EXPECT_EQ(client->calls.last().text + u' ' + client->paths.last(), expected + u' ' + path);
    }
}

TEST_F(CameraProxyTest, OneRequestInFlightPerCameraCoveredWindowsDroppedFailureEmptiesTheQueue)
{
    send("a", 40, 100);
    send("a", 100, 130); // queued even with an earlier end: the queue is empty
    send("b", 0, 60);    // another camera goes out at once
    send("a", 130, 160);
    send("a", 90, 150);        // ends before the last queued window: dropped
    send("a", 100, 160);       // equal end: queued
    send("a", 90, 150, false); // client-requested: never dropped
    EXPECT_EQ(client->paths, (QStringList{metaPath(40, 100), metaPath(0, 60)}));

    // Each answer sends the next queued window of that camera, in order.
    QSignalSpy answers(proxy.get(), &CameraProxy::receiveObjectMeta);
    for (int i : {0, 2, 3, 4}) {
        client->complete(i, QNetworkReply::NoError, "{}");
    }
    EXPECT_EQ(client->paths.mid(2),
              (QStringList{metaPath(100, 130), metaPath(130, 160), metaPath(100, 160), metaPath(90, 150)}));
    EXPECT_EQ(answers.size(), 4);

    // A failure empties only that camera's queue; the camera is idle again.
    send("a", 200, 260);
    send("a", 260, 320);
    send("b", 60, 120);
    client->complete(5, QNetworkReply::ConnectionRefusedError, QByteArray());
    EXPECT_EQ(client->calls.size(), 6);
    client->complete(1, QNetworkReply::NoError, "{}"); // b goes on
    send("a", 320, 380);
    EXPECT_EQ(client->paths.mid(6), (QStringList{metaPath(60, 120), metaPath(320, 380)}));
}

TEST_F(CameraProxyTest, AnswersCountObjectsAndUnusableAnswersFail)
{
    QSignalSpy answers(proxy.get(), &CameraProxy::receiveObjectMeta);
    QSignalSpy failed(proxy.get(), &CameraProxy::requestFailed);
    const std::tuple<QNetworkReply::NetworkError, QByteArray, int> rows[] = {
        // count -1: failed
        {QNetworkReply::NoError, "{\"ObjectMetaInfo\": []}", 0},
        {QNetworkReply::NoError, "{\"ObjectMetaInfo\":[{},{},{}]}", 3},
        {QNetworkReply::NoError, "{\"ObjectMetaInfo\":{\"ID\":1}}", 0},
        {QNetworkReply::NoError, "{\"ObjectMetaInfo\": [", -1},
        {QNetworkReply::ContentAccessDenied, "{}", -1}};
    for (const auto& [error, body, count] : rows) {
        const int i = client->calls.size();
        send(QString::number(i), 100, 160 + i);
        client->complete(i, error, body);
        // The request's own end, and the answer with its number of objects.
        EXPECT_EQ(count < 0 ? failed.last() : answers.last(),
                  count < 0 ? QList<QVariant>{QString::number(i)}
                            : (QList<QVariant>{QString::number(i), 160u + unsigned(i),
                                               QVariantMap{{"count", count}, {"data", body}}}))
            << body.constData();
    }
    EXPECT_EQ(answers.size() * 10 + failed.size(), 32);
}

TEST_F(CameraProxyTest, PairTokenExchangeBypassesTheQueue)
{
    const QVariantMap record{{"Name", "vault"},     {"IP", "10.0.0.5"},   {"Port", "8443"},
                             {"User", "op"},        {"Password", "7077"}, {"UseSSL", true},
                             {"MultiChannelID", 3}, {"Location", "Loc4"}};
    QSignalSpy tokens(proxy.get(), &CameraProxy::receivePairToken);
    send("vault", 0, 60);
    send("vault", 60, 120);
    proxy->sendPairTokenRequest(record); // goes out although a metadata request is outstanding
    ASSERT_EQ(client->calls.size(), 2);
    EXPECT_EQ(client->calls.last().text,
              "op:pw@10.0.0.5:8443 ssl /VCA/Secure/Token?method=GET&resource=/Data/DB/ObjMeta&client=NOVIR2");
    client->complete(1, QNetworkReply::NoError, QString::fromUtf8("tok\xc3\xa9n").toUtf8());
    client->complete(0, QNetworkReply::NoError, "{}"); // the token answer did not advance the queue
    proxy->sendPairTokenRequest(record);
    client->complete(3, QNetworkReply::ConnectionRefusedError, QByteArray());
    EXPECT_EQ(tokens, (QList<QList<QVariant>>{{"vault", QString::fromUtf8("tok\xc3\xa9n")}}));
    EXPECT_EQ(client->paths.value(2), metaPath(60, 120));
    EXPECT_EQ(proxy->composePairTokenRequest({{"MultiChannel", 2}}).value("path").toString().left(12),
              "/VCA/c2/Secu");

    // Completions after the proxy is gone touch nothing.
    send("vault", 120, 180);
    proxy->sendPairTokenRequest(record);
    proxy.reset();
    client->complete(2, QNetworkReply::NoError, "{}");
    client->complete(4, QNetworkReply::NoError, "token");
    EXPECT_EQ(client->calls.size(), 5);
}
