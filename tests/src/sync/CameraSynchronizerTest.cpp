// The synchroniser with a recording proxy and a simulated clock (windows of a pass, last-sync rules,
// enable switch, pair and access tokens, client-requested windows, settings files), its wiring into
// the plug-in, and end to end over loopback against simulated cameras.
#include "CameraSynchronizer.h"
#include "BraskHttpClient.h"
#include "CameraSimulator.h"
#include "DelvixKeys.h"
#include "HostFakes.h"
#include "PluginDelvixSrv.h"
#include "ReplyRecorder.h"
#include "TestWait.h"

#include <QDateTime>
#include <QDir>
#include <QJsonDocument>
#include <QJsonObject>
#include <QSignalSpy>
#include <QTemporaryDir>
#include <QThread>
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

using namespace Qt::StringLiterals;

namespace {

constexpr qint64 T = 1'700'000'000;
using Windows = QList<QPair<qint64, qint64>>;

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
    Windows windows(const QString& camera) const
    {
        Windows result;
        for (const QVariantMap& r : requests) {
            if (r.value("cameraID") == camera) {
                result.append({r.value("startTimestamp").toLongLong(), r.value("endTimestamp").toLongLong()});
            }
        }
        return result;
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

} // namespace

TEST_F(CameraSynchronizerTest, WindowsOfAPassFollowTheLastSyncTime)
{
    QVariantMap channel = record("yard-c1");
    channel.insert("MultiChannelID", "1");
    QVariantMap cameras{{"yard-c1", channel}};
    for (const char* name : {"fresh", "behind", "far", "recent", "future"}) {
        cameras.insert(name, record(name));
    }
    make().updateInformation(cameras);
    sync->updateLastSync({{"behind", uint(T - 600)},
                          {"far", uint(T - 7200)},
                          {"recent", uint(T - 180)},
                          {"future", uint(T + 500)}});
    sync->synchronize();
    // "count first-start..last-end" against the present; at most an hour's worth per pass.
    QStringList spans;
    for (const char* camera : {"fresh", "behind", "far", "recent", "future"}) {
        const Windows w = proxy->windows(camera);
        spans << (w.isEmpty()
                      ? u"0"_s
                      : u"%1 %2..%3"_s.arg(w.size()).arg(w.first().first - T).arg(w.last().second - T));
    }
    EXPECT_EQ(spans, (QStringList{"1 -240..-180", "7 -600..-180", "60 -7200..-3600", "0", "0"}));
    EXPECT_EQ(
        QJsonDocument(QJsonObject::fromVariantMap(proxy->requests.last())).toJson(QJsonDocument::Compact),
        R"({"accessToken":"","cameraID":"yard-c1","endTimestamp":1699999820,"ip":"127.0.0.1",)"
        R"("multiChannelID":"1","password":"6162","port":8000,"startTimestamp":1699999760,)"
        R"("useSSL":false,"username":"admin"})");
    EXPECT_FALSE(proxy->requests.first().contains("multiChannelID"));
}

TEST_F(CameraSynchronizerTest, LastSyncNeverMovesBackAndCamerasThatLeftAreIgnored)
{
    make().updateInformation({{"a", record("a")}});
    QSignalSpy forwarded(sync.get(), &CameraSynchronizer::receiveResponseData);
    const QVariantMap data{{"data", QByteArray("{}")}, {"count", 2}};
    QList<uint> seen;
    for (uint end : {500u, 400u, 0u, 7u, 0xF0000000u}) { // older windows still forwarded; compared unsigned
        if (end == 0) {
            sync->updateLastSync({{"a", 0u}});
            continue;
        }
        sync->receiveObjectMeta("a", end, data);
        seen << sync->getLastSyncMap().value("a").toUInt();
    }
    EXPECT_EQ(seen, (QList<uint>{500u, 500u, 7u, 0xF0000000u}));
    EXPECT_EQ(forwarded[1], (QList<QVariant>{record("a"), 400u, data}));
    sync->receiveObjectMeta("gone", 900, data);
    EXPECT_EQ(forwarded.size(), 4); // a camera that left: neither forwarded nor kept
    sync->removeCameraLastSync("a");
    EXPECT_TRUE(sync->getLastSyncMap().isEmpty());

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
    EXPECT_EQ(proxy->windows("a"), (Windows{{T - 240, T - 180}}));
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
    EXPECT_TRUE(
        proxy->requests[proxy->requests.size() - 2].value("accessToken").toString().isEmpty()); // open
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
    ASSERT_EQ(proxy->windows("yard-c0"), (Windows{{T - 9000, T - 100}}));
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
        EXPECT_EQ(proxy->windows("a"), (Windows{{T - d - p, T - d}})) << period << " " << delay;
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
    QStringList writes;
    for (const FakeCollector::Write& write : collector->writes()) {
        writes << u"%1/%2 %3"_s.arg(write.group).arg(write.location).arg(write.data);
    }
    const QString written = "2/%1 {\"ObjectMetaInfo\":[{\"ID\":1}]}";
    EXPECT_EQ(writes, (QStringList{written.arg(12), written.arg(12), written.arg(0)}));

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
    EXPECT_EQ(client->paths(), QStringList{"/VCA/Data/DB/ObjectMeta?StartTime=1000&EndTime=5000&Info=127"});
    EXPECT_TRUE(replies.replies().empty());
}

// Simulated cameras (plain, protected, multi-channel, failing, slow), the real HTTP client, the proxy
// and the synchroniser on this thread's event loop.
TEST_F(CameraSynchronizerTest, EndToEndEveryHealthyCameraIsFetchedWhateverTheOthersDo)
{
    QList<CameraSetup> setups;
    for (const char* name : {"door", "vault", "yard", "broken", "sluggish"}) {
        setups << CameraSetup{};
        setups.last().name = name;
        setups.last().password = "pa:ss";
        setups.last().objectsPerMinute = 20;
    }
    setups[1].protectedMetadata = true;
    setups[1].useSSL = true;
    setups[2].channels = 2;
    setups[2].digestAuth = true;
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
    EXPECT_EQ(tokens[0][0].toString(), "vault");
    const qint64 now = QDateTime::currentSecsSinceEpoch();
    sync.synchronize();

    // The four healthy sources answer while the slow camera is still thinking.
    ASSERT_TRUE(waitFor([&] { return answers.size() >= 4 && failures.size() >= 1; }));
    EXPECT_EQ(failures, QList<QList<QVariant>>{{"broken"}});
    QStringList answered;
    for (const QList<QVariant>& answer : answers) {
        const QVariantMap record = answer[0].toMap();
        const QString name = record.value("Name").toString();
        answered << name;
        const unsigned int end = answer[1].toUInt();
        EXPECT_TRUE(qint64(end) >= now - 180 && qint64(end) <= now - 175);
        const QString source =
            record.contains("MultiChannelID") ? "yard/c" + record.value("MultiChannelID").toString() : name;
        EXPECT_EQ(answer[2].toMap().value("count").toInt(),
                  cameras.generator().objectCount(source, end - 60, end, 20))
            << qPrintable(name);
        EXPECT_EQ(sync.getLastSyncMap().value(name).toUInt(), end);
    }
    answered.sort();
    EXPECT_EQ(answered, (QStringList{"door", "vault", "yard-c0", "yard-c1"}));
    EXPECT_EQ(sync.getLastSyncMap().keys(), answered); // neither the failing nor the slow camera

    // The protected camera was asked on the token path and let the request in.
    bool vaultByToken = false;
    for (const ServedRequest& served : cameras.servedRequests()) {
        vaultByToken |= served.camera == "vault" && served.status == 200 && served.withAccessToken;
    }
    EXPECT_TRUE(vaultByToken);
}
