// The synchroniser with a recording proxy and a simulated clock: the windows of a pass, last-sync
// rules, enable switch, pair tokens and the access tokens made from them, client-requested windows
// and the settings files.
#include "CameraSynchronizer.h"
#include "FakeWemlo.h"
#include "HostFakes.h"
#include "LogFacility.h"
#include "TokenConverter.h"

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

bool acceptedBy(const std::string& pairToken, const std::string& accessToken)
{
    auto camera = Zelto::CreateProtectedAPIManager("", 0, true);
    camera->SetPairToken(pairToken.data(), pairToken.size(), true);
    return camera->VerifyAccessToken(accessToken);
}

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
    void writeFile(const QString& name, const QByteArray& content)
    {
        QFile file(dir.filePath(name));
        ASSERT_TRUE(file.open(QIODevice::WriteOnly));
        file.write(content);
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
    make().updateInformation({{"fresh", record("fresh")},
                              {"behind", record("behind")},
                              {"far", record("far")},
                              {"recent", record("recent")},
                              {"future", record("future")},
                              {"yard-c1", channel}});
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
    sync->receiveObjectMeta("a", 500, data);
    sync->receiveObjectMeta("a", 400, data); // older window: still forwarded, time kept
    EXPECT_EQ(sync->getLastSyncMap().value("a").toUInt(), 500u);
    ASSERT_EQ(forwarded.size(), 2);
    EXPECT_EQ(forwarded[1], (QList<QVariant>{record("a"), 400u, data}));
    sync->updateLastSync({{"a", 0u}});
    sync->receiveObjectMeta("a", 7, data);
    EXPECT_EQ(sync->getLastSyncMap().value("a").toUInt(), 7u);
    sync->receiveObjectMeta("a", 0xF0000000u, data); // compared unsigned
    EXPECT_EQ(sync->getLastSyncMap().value("a").toUInt(), 0xF0000000u);

    sync->receiveObjectMeta("gone", 900, data);
    EXPECT_FALSE(sync->getLastSyncMap().contains("gone"));
    EXPECT_EQ(forwarded.size(), 4);
    sync->removeCameraLastSync("a");
    EXPECT_TRUE(sync->getLastSyncMap().isEmpty());

    // Disabled: last sync forgotten, nothing sent, not even on request; enabled again it starts afresh.
    sync->updateLastSync({{"a", uint(T - 600)}});
    for (const QVariantMap& settings : {QVariantMap{{"enable", false}}, QVariantMap{}}) {
        sync->setEnableDelvix(settings);
        sync->synchronize();
        sync->retrieveDelvixData("a", T - 1000, T - 900);
        QCoreApplication::processEvents();
        EXPECT_TRUE(sync->getLastSyncMap().isEmpty());
        EXPECT_TRUE(proxy->requests.isEmpty());
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
    const QVariantMap vault = proxy->requests.last();
    EXPECT_EQ(vault.value("cameraID"), "vault");
    EXPECT_TRUE(acceptedBy(pairToken, vault.value("accessToken").toString().toStdString()));
    EXPECT_TRUE(
        proxy->requests[proxy->requests.size() - 2].value("accessToken").toString().isEmpty()); // open

    QVariantMap changed = cameras;
    changed.insert("other", record("other", true));
    sync->updateInformation(changed); // any change forgets every token and asks every protected camera
    EXPECT_EQ(proxy->tokenRequests.size(), 4);
    sync->synchronize();
    EXPECT_EQ(proxy->tokenRequests.size(), 6);
}

TEST(TokenConverter, AccessTokensAreFreshAndAcceptedOnlyForTheirPairToken)
{
    TokenConverter converter;
    const std::string pairToken = Zelto::GeneratePairToken();
    const std::string first = converter.genAccessToken(pairToken);
    const std::string second = converter.genAccessToken(pairToken);
    EXPECT_NE(first, second);
    EXPECT_TRUE(acceptedBy(pairToken, first));
    EXPECT_TRUE(acceptedBy(pairToken, second));
    EXPECT_FALSE(acceptedBy(pairToken, converter.genAccessToken(Zelto::GeneratePairToken())));
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

    // Answers of a proxy set later still arrive.
    make().updateInformation({{"a", record("a")}});
    auto client = std::make_shared<RecordingHttpClient>();
    sync->setHttpClient(std::make_shared<CameraProxy>(client));
    sync->synchronize();
    ASSERT_EQ(client->calls.size(), 1);
    client->complete(0, QNetworkReply::NoError, "{\"ObjectMetaInfo\":[{}]}");
    EXPECT_EQ(sync->getLastSyncMap().value("a").toUInt(), uint(T - 180));
}

TEST_F(CameraSynchronizerTest, SettingsFiles)
{
    struct Row
    {
        const char* period; // routineSyncTimeBuffer.txt, null: absent
        const char* delay;  // getObjectDataTimeBuffer.txt, null: absent
        int expectedPeriod;
        unsigned expectedDelay;
        bool logged;
    };
    const std::vector<Row> rows{
        {nullptr, nullptr, 60, 180, false},
        {"10\n30\n", "120", 30, 120, false},
        {"30\n", nullptr, 30, 180, false},
        // Periods that would spin the timer or overflow its interval fall back to 60 s; so does a
        // file whose last line is empty.
        {"0", nullptr, 60, 180, true},
        {"-5", nullptr, 60, 180, true},
        {"sixty", nullptr, 60, 180, true},
        {"3000000", nullptr, 60, 180, true},
        {"60\n\n", nullptr, 60, 180, true},
        // Not a number reads as 0, which is usable; a delay beyond the present is not.
        {nullptr, "later", 60, 0, false},
        {nullptr, "4000000000", 60, 180, true},
    };
    for (const Row& row : rows) {
        QFile::remove(dir.filePath("routineSyncTimeBuffer.txt"));
        QFile::remove(dir.filePath("getObjectDataTimeBuffer.txt"));
        if (row.period) {
            writeFile("routineSyncTimeBuffer.txt", row.period);
        }
        if (row.delay) {
            writeFile("getObjectDataTimeBuffer.txt", row.delay);
        }
        fakeWemloReset();
        LogFacility::reload(FAKE_WEMLO_PATH);
        make().updateInformation({{"a", record("a")}});
        EXPECT_EQ(sync->routineSyncPeriodSecond(), row.expectedPeriod) << row.period;
        EXPECT_EQ(sync->timerIntervalMs(), row.expectedPeriod * 1000) << row.period;
        EXPECT_EQ(sync->delayGetObjectDataSecond(), row.expectedDelay) << row.delay;
        EXPECT_EQ(fakeWemloState().lines.size(), row.logged ? 1u : 0u) << row.period << " " << row.delay;
        sync->synchronize();
        const qint64 end = T - row.expectedDelay;
        EXPECT_EQ(proxy->windows("a"), (Windows{{end - row.expectedPeriod, end}}))
            << row.period << " " << row.delay;
    }
}
