// The synchroniser with a recording proxy and a simulated clock: the windows of a pass, last-sync
// rules, enable switch, pair tokens, client-requested windows and the settings files.
#include "CameraSynchronizer.h"
#include "FakeWemlo.h"
#include "LogFacility.h"
#include "RecordingHttpClient.h"

#include <QCoreApplication>
#include <QDir>
#include <QFile>
#include <QSignalSpy>
#include <QTemporaryDir>
#include <QThread>
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

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
        dropFlags.append(dropCovered);
        threads.append(QThread::currentThread());
    }
    void sendPairTokenRequest(const QVariantMap& record) override { tokenRequests.append(record); }

    QList<QPair<qint64, qint64>> windows(const QString& camera) const
    {
        QList<QPair<qint64, qint64>> result;
        for (const QVariantMap& r : requests) {
            if (r.value("cameraID").toString() == camera) {
                result.append({r.value("startTimestamp").toLongLong(), r.value("endTimestamp").toLongLong()});
            }
        }
        return result;
    }

    QList<QVariantMap> requests;
    QList<bool> dropFlags;
    QList<QThread*> threads;
    QList<QVariantMap> tokenRequests;
};

class CameraSynchronizerTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        fakeWemloReset();
        LogFacility::reload(FAKE_WEMLO_PATH);
        ASSERT_TRUE(m_dir.isValid());
        m_previousDir = QDir::currentPath();
        QDir::setCurrent(m_dir.path()); // the settings files are read from the working directory
    }
    void TearDown() override
    {
        m_sync.reset();
        QDir::setCurrent(m_previousDir);
        fakeWemloReset();
    }

    void writeFile(const QString& name, const QByteArray& content)
    {
        QFile file(m_dir.filePath(name));
        ASSERT_TRUE(file.open(QIODevice::WriteOnly));
        file.write(content);
    }

    CameraSynchronizer& make()
    {
        m_proxy = std::make_shared<RecordingProxy>();
        m_sync = std::make_unique<CameraSynchronizer>(m_proxy, [this] { return m_nowMs.load(); });
        return *m_sync;
    }

    static QVariantMap record(const QString& name, bool protect = false)
    {
        return QVariantMap{
            {"Name", name},       {"IP", "127.0.0.1"}, {"Port", "8000"},           {"User", "admin"},
            {"Password", "6162"}, {"UseSSL", false},   {"DelvixProtect", protect}, {"Location", "Loc3"},
            {"GroupID", 2}};
    }

    static int errorLines()
    {
        int n = 0;
        for (const FakeWemloLine& line : fakeWemloState().lines) {
            n += line.text.find("not usable") != std::string::npos ? 1 : 0;
        }
        return n;
    }

    QTemporaryDir m_dir;
    QString m_previousDir;
    std::atomic<qint64> m_nowMs{T * 1000 + 999}; // the milliseconds are cut off
    std::shared_ptr<RecordingProxy> m_proxy;
    std::unique_ptr<CameraSynchronizer> m_sync;
};

using Windows = QList<QPair<qint64, qint64>>;

} // namespace

TEST_F(CameraSynchronizerTest, WindowsOfAPassFollowTheLastSyncTime)
{
    CameraSynchronizer& sync = make();
    QVariantMap channel = record("yard-c1");
    channel.insert("MultiChannelID", "1");
    sync.updateInformation({{"fresh", record("fresh")},
                            {"behind", record("behind")},
                            {"far", record("far")},
                            {"recent", record("recent")},
                            {"future", record("future")},
                            {"yard-c1", channel}});
    sync.updateLastSync({{"behind", uint(T - 600)},
                         {"far", uint(T - 7200)},
                         {"recent", uint(T - 180)},
                         {"future", uint(T + 500)}});
    sync.synchronize();

    EXPECT_EQ(m_proxy->windows("fresh"), (Windows{{T - 240, T - 180}}));
    Windows seven;
    for (qint64 s = T - 600; s < T - 180; s += 60) {
        seven.append({s, s + 60});
    }
    EXPECT_EQ(m_proxy->windows("behind"), seven);
    const Windows far = m_proxy->windows("far");
    ASSERT_EQ(far.size(), 60);
    EXPECT_EQ(far.first(), (QPair<qint64, qint64>{T - 7200, T - 7140}));
    EXPECT_EQ(far.last(), (QPair<qint64, qint64>{T - 3660, T - 3600}));
    EXPECT_TRUE(m_proxy->windows("recent").isEmpty());
    EXPECT_TRUE(m_proxy->windows("future").isEmpty());
    for (bool drop : m_proxy->dropFlags) {
        EXPECT_TRUE(drop);
    }

    const QVariantMap request = m_proxy->requests.last();
    EXPECT_EQ(request, (QVariantMap{{"cameraID", "yard-c1"},
                                    {"startTimestamp", T - 240},
                                    {"endTimestamp", T - 180},
                                    {"ip", "127.0.0.1"},
                                    {"port", 8000},
                                    {"username", "admin"},
                                    {"password", "6162"},
                                    {"useSSL", false},
                                    {"accessToken", QString()},
                                    {"multiChannelID", "1"}}));
    EXPECT_EQ(request.value("startTimestamp").typeId(), QMetaType::LongLong);
    EXPECT_EQ(request.value("port").typeId(), QMetaType::Int);
    EXPECT_FALSE(m_proxy->requests.first().contains("multiChannelID"));
}

TEST_F(CameraSynchronizerTest, LastSyncNeverMovesBackAndCamerasThatLeftAreIgnored)
{
    CameraSynchronizer& sync = make();
    sync.updateInformation({{"a", record("a")}});
    QSignalSpy forwarded(&sync, &CameraSynchronizer::receiveResponseData);
    const QVariantMap data{{"data", QByteArray("{}")}, {"count", 2}};

    sync.receiveObjectMeta("a", 500, data);
    sync.receiveObjectMeta("a", 400, data); // older window: still forwarded, time kept
    EXPECT_EQ(sync.getLastSyncMap().value("a").toUInt(), 500u);
    ASSERT_EQ(forwarded.size(), 2);
    EXPECT_EQ(forwarded[1][0].toMap(), record("a"));
    EXPECT_EQ(forwarded[1][1].toUInt(), 400u);
    EXPECT_EQ(forwarded[1][2].toMap(), data);
    sync.updateLastSync({{"a", 0u}});
    sync.receiveObjectMeta("a", 7, data);
    EXPECT_EQ(sync.getLastSyncMap().value("a").toUInt(), 7u);
    sync.receiveObjectMeta("a", 0xF0000000u, data); // compared unsigned
    EXPECT_EQ(sync.getLastSyncMap().value("a").toUInt(), 0xF0000000u);

    sync.receiveObjectMeta("gone", 900, data);
    EXPECT_FALSE(sync.getLastSyncMap().contains("gone"));
    EXPECT_EQ(forwarded.size(), 4);

    sync.removeCameraLastSync("a");
    EXPECT_TRUE(sync.getLastSyncMap().isEmpty());
}

TEST_F(CameraSynchronizerTest, DisabledSyncForgetsLastSyncAndSendsNothing)
{
    CameraSynchronizer& sync = make();
    sync.updateInformation({{"a", record("a")}});
    sync.updateLastSync({{"a", uint(T - 600)}});
    for (const QVariantMap& settings : {QVariantMap{{"enable", false}}, QVariantMap{}}) {
        sync.setEnableDelvix(settings);
        sync.synchronize();
        sync.retrieveDelvixData("a", T - 1000, T - 900);
        EXPECT_TRUE(sync.getLastSyncMap().isEmpty());
        EXPECT_TRUE(m_proxy->requests.isEmpty());
    }
    sync.setEnableDelvix({{"enable", true}});
    sync.synchronize();
    EXPECT_EQ(m_proxy->windows("a"), (Windows{{T - 240, T - 180}})); // starts afresh
}

TEST_F(CameraSynchronizerTest, DirectoryChangesAskProtectedCamerasForPairTokens)
{
    CameraSynchronizer& sync = make();
    const QVariantMap cameras{{"open", record("open")}, {"vault", record("vault", true)}};
    sync.updateInformation(cameras);
    ASSERT_EQ(m_proxy->tokenRequests.size(), 1);
    EXPECT_EQ(m_proxy->tokenRequests[0], record("vault", true));
    sync.updateInformation(cameras); // equal: nothing
    EXPECT_EQ(m_proxy->tokenRequests.size(), 1);

    sync.synchronize(); // still no token: asked again, and synchronised unprotected meanwhile
    EXPECT_EQ(m_proxy->tokenRequests.size(), 2);
    EXPECT_EQ(m_proxy->requests.last().value("accessToken").toString(), QString());

    const std::string pairToken = Zelto::GeneratePairToken();
    sync.receivePairToken("vault", QString::fromStdString(pairToken));
    m_nowMs += 60'000;
    sync.synchronize();
    EXPECT_EQ(m_proxy->tokenRequests.size(), 2);
    const QString token = m_proxy->requests.last().value("accessToken").toString();
    auto camera = Zelto::CreateProtectedAPIManager("", 0, true);
    camera->SetPairToken(pairToken.data(), pairToken.size(), true);
    EXPECT_TRUE(camera->VerifyAccessToken(token.toStdString()));
    EXPECT_EQ(m_proxy->requests.last().value("cameraID").toString(), "vault");
    EXPECT_TRUE(
        m_proxy->requests[m_proxy->requests.size() - 2].value("accessToken").toString().isEmpty()); // open

    QVariantMap changed = cameras;
    changed.insert("other", record("other", true));
    sync.updateInformation(changed); // any change forgets every token and asks every protected camera
    EXPECT_EQ(m_proxy->tokenRequests.size(), 4);
    sync.synchronize();
    EXPECT_EQ(m_proxy->tokenRequests.size(), 6);
}

TEST_F(CameraSynchronizerTest, ClientRequestedWindowIsOneRequestOnTheOwnerThread)
{
    CameraSynchronizer& sync = make();
    QVariantMap channel = record("yard-c0");
    channel.insert("MultiChannelID", 0);
    sync.updateInformation({{"yard-c0", channel}});
    sync.retrieveDelvixData("nobody", T - 9000, T - 100);
    EXPECT_TRUE(m_proxy->requests.isEmpty());

    std::thread host([&] { sync.retrieveDelvixData("yard-c0", T - 9000, T - 100); });
    host.join();
    EXPECT_TRUE(m_proxy->requests.isEmpty()); // not on the host's thread
    QCoreApplication::processEvents();
    ASSERT_EQ(m_proxy->requests.size(), 1);
    EXPECT_EQ(m_proxy->threads[0], QThread::currentThread());
    EXPECT_FALSE(m_proxy->dropFlags[0]);
    EXPECT_EQ(m_proxy->windows("yard-c0"), (Windows{{T - 9000, T - 100}}));
    EXPECT_EQ(m_proxy->requests[0].value("multiChannelID").toInt(), 0);

    // A call still on its way when the synchroniser goes is dropped, not run on a dead object.
    std::thread late([&] { sync.retrieveDelvixData("yard-c0", T - 50, T); });
    late.join();
    m_sync.reset();
    QCoreApplication::processEvents();
    EXPECT_EQ(m_proxy->requests.size(), 1);
}

TEST_F(CameraSynchronizerTest, ReplacedProxyAnswersStillArrive)
{
    CameraSynchronizer& sync = make();
    sync.updateInformation({{"a", record("a")}});
    auto client = std::make_shared<RecordingHttpClient>();
    auto proxy = std::make_shared<CameraProxy>(client);
    sync.setHttpClient(proxy);
    sync.synchronize();
    ASSERT_EQ(client->calls.size(), 1);
    client->complete(0, QNetworkReply::NoError, "{\"ObjectMetaInfo\":[{}]}");
    EXPECT_EQ(sync.getLastSyncMap().value("a").toUInt(), uint(T - 180));
}

TEST_F(CameraSynchronizerTest, SettingsFilesAbsentPresentAndUnusable)
{
    {
        CameraSynchronizer& sync = make();
        EXPECT_EQ(sync.routineSyncPeriodSecond(), 60);
        EXPECT_EQ(sync.delayGetObjectDataSecond(), 180u);
        EXPECT_EQ(sync.timerIntervalMs(), 60000);
    }
    writeFile("routineSyncTimeBuffer.txt", "10\n30\n");
    writeFile("getObjectDataTimeBuffer.txt", "120");
    {
        CameraSynchronizer& sync = make();
        EXPECT_EQ(sync.routineSyncPeriodSecond(), 30);
        EXPECT_EQ(sync.delayGetObjectDataSecond(), 120u);
        EXPECT_EQ(sync.timerIntervalMs(), 30000);
        sync.updateInformation({{"a", record("a")}});
        sync.synchronize();
        EXPECT_EQ(m_proxy->windows("a"), (Windows{{T - 150, T - 120}}));
    }
    EXPECT_EQ(errorLines(), 0);

    // Periods that would spin the timer or overflow its interval fall back to 60 s, logged.
    const QByteArray badPeriods[] = {"0", "-5", "sixty", "30\n", "3000000"};
    int expectedLines = 0;
    for (const QByteArray& bad : badPeriods) {
        writeFile("routineSyncTimeBuffer.txt", bad);
        CameraSynchronizer& sync = make();
        const bool usable = bad == "30\n";
        EXPECT_EQ(sync.routineSyncPeriodSecond(), usable ? 30 : 60) << bad.constData();
        expectedLines += usable ? 0 : 1;
        EXPECT_EQ(errorLines(), expectedLines);
    }
    writeFile("routineSyncTimeBuffer.txt", "60\n\n"); // the last line is empty: unusable
    EXPECT_EQ(make().routineSyncPeriodSecond(), 60);
    EXPECT_EQ(errorLines(), ++expectedLines);

    writeFile("routineSyncTimeBuffer.txt", "60");
    writeFile("getObjectDataTimeBuffer.txt", "later");
    EXPECT_EQ(make().delayGetObjectDataSecond(), 0u);       // not a number reads as 0, which is usable
    writeFile("getObjectDataTimeBuffer.txt", "4000000000"); // beyond the present
    {
        CameraSynchronizer& sync = make();
        EXPECT_EQ(sync.delayGetObjectDataSecond(), 180u);
        EXPECT_EQ(errorLines(), ++expectedLines);
        sync.updateInformation({{"a", record("a")}});
        sync.synchronize();
        EXPECT_EQ(m_proxy->windows("a"), (Windows{{T - 240, T - 180}}));
    }
}
