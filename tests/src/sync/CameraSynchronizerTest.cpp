// The synchroniser with a recording proxy and a simulated clock: the windows of a pass, last-sync
// rules, enable switch, pair tokens and the access tokens made from them, client-requested windows
// and the settings files.
#include "CameraSynchronizer.h"
#include "FakeWemlo.h"
#include "HostFakes.h"
#include "LogFacility.h"

#include <QCoreApplication>
#include <QDir>
#include <QFile>
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

class CameraSynchronizerTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        fakeWemloReset();
        LogFacility::reload(FAKE_WEMLO_PATH);
        previousDir = QDir::currentPath();
        QDir::setCurrent(dir.path()); // the settings files are read from the working directory
    }
    void TearDown() override
    {
        sync.reset();
        QDir::setCurrent(previousDir);
        fakeWemloReset();
    }
    CameraSynchronizer& make()
    {
        proxy = std::make_shared<RecordingProxy>();
        sync = std::make_unique<CameraSynchronizer>(proxy, [this] { return nowMs.load(); });
        return *sync;
    }
    static QVariantMap record(const QString& name, bool protect = false)
    {
        return QVariantMap{
            {"Name", name},       {"IP", "127.0.0.1"}, {"Port", "8000"},           {"User", "admin"},
            {"Password", "6162"}, {"UseSSL", false},   {"DelvixProtect", protect}, {"Location", "Loc3"},
            {"GroupID", 2}};
    }

    QTemporaryDir dir;
    QString previousDir;
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
    EXPECT_EQ(proxy->tokenRequests.size(), 1);
    sync->synchronize(); // still no token: asked again, and fetched unprotected meanwhile
    EXPECT_EQ(proxy->tokenRequests.size(), 2);
    EXPECT_EQ(proxy->requests.last().value("accessToken").toString(), QString());

    const std::string pairToken = Zelto::GeneratePairToken();
    sync->receivePairToken("vault", QString::fromStdString(pairToken));
    nowMs += 60'000;
    sync->synchronize();
    EXPECT_EQ(proxy->tokenRequests.size(), 2);
    EXPECT_TRUE(
        proxy->requests[proxy->requests.size() - 2].value("accessToken").toString().isEmpty()); // open
    const QVariantMap vault = proxy->requests.last();
    auto camera = Zelto::CreateProtectedAPIManager("", 0, true);
    camera->SetPairToken(pairToken.data(), pairToken.size(), true);
    EXPECT_TRUE(camera->VerifyAccessToken(vault.value("accessToken").toString().toStdString()));

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
    // routineSyncTimeBuffer.txt, getObjectDataTimeBuffer.txt (null: absent), "period delay logged".
    // Periods that would spin the timer or overflow its interval fall back to 60 s, as does a file
    // whose last line is empty; not a number reads as 0, which is a usable delay.
    const char* rows[][3] = {{nullptr, nullptr, "60 180 0"},     {"10\n30\n", "120", "30 120 0"},
                             {"0", nullptr, "60 180 1"},         {"-5", nullptr, "60 180 1"},
                             {"sixty", nullptr, "60 180 1"},     {"3000000", nullptr, "60 180 1"},
                             {"60\n\n", nullptr, "60 180 1"},    {nullptr, "later", "60 0 0"},
                             {nullptr, "4000000000", "60 180 1"}};
    for (const auto& [period, delay, expected] : rows) {
        int i = 0;
        for (const char* content : {period, delay}) {
            QFile file(dir.filePath(i++ ? "getObjectDataTimeBuffer.txt" : "routineSyncTimeBuffer.txt"));
            file.remove();
            ASSERT_TRUE(!content || (file.open(QIODevice::WriteOnly) && file.write(content) >= 0));
        }
        fakeWemloReset();
        LogFacility::reload(FAKE_WEMLO_PATH);
        make().updateInformation({{"a", record("a")}});
        const int p = sync->routineSyncPeriodSecond();
        const qint64 d = sync->delayGetObjectDataSecond();
        EXPECT_EQ(u"%1 %2 %3"_s.arg(p).arg(d).arg(fakeWemloState().lines.size()), QString::fromUtf8(expected))
            << period << " " << delay;
        EXPECT_EQ(sync->timerIntervalMs(), p * 1000);
        sync->synchronize();
        EXPECT_EQ(proxy->windows("a"), (Windows{{T - d - p, T - d}})) << period << " " << delay;
    }
}
