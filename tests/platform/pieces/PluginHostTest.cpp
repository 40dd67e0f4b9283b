// The in-process host: the plug-in module loads and foreign ones are refused, requests run on request
// threads, the plug-in manager connects plug-in signals, and the relay reaches the servers in host.json.
#include "PluginHost.h"
#include "TestWait.h"

#include <QDir>
#include <QMutex>
#include <QSet>
#include <QSettings>
#include <QTemporaryDir>
#include <QThread>
#include <gtest/gtest.h>

#include <atomic>

using namespace Qt::StringLiterals;

namespace {

class PathReceiver : public QObject
{
    Q_OBJECT
public:
    QStringList paths;
public slots:
    void onServerDatabasePathChanged(const QString& path) { paths << path; }
};

} // namespace

TEST(PluginHost, LoadsThePluginDeliversRequestsOnRequestThreadsAndRefusesForeignModules)
{
    QTemporaryDir data;
    PluginHost host(data.path());
    for (const auto& [path, why] : {std::pair{QString(WRONG_IID_MODULE_PATH), "interface id"},
                                    {QString(WRONG_ID_MODULE_PATH), "PluginID"},
                                    {data.filePath(u"no.so"_s), "not found"}}) {
        QString error;
        EXPECT_FALSE(host.load(path, &error));
        EXPECT_TRUE(error.contains(QLatin1String(why))) << qPrintable(error);
        EXPECT_EQ(host.plugin(), nullptr);
    }
    QString error;
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
    QMutexLocker lock(&mutex);
    EXPECT_EQ(threads.size(), 40);
    EXPECT_FALSE(threads.contains(QThread::currentThread()));
    lock.unlock();
    host.unload();
    EXPECT_EQ(host.plugin(), nullptr);
}

TEST(PluginHost, ManagerConnectsPluginSignalsAndTheRelayReachesRemoteServers)
{
    QTemporaryDir data;
    QFile config(data.filePath(u"host.json"_s));
    ASSERT_TRUE(config.open(QIODevice::WriteOnly) && config.write(R"({"remoteServers": ["", "east"]})") > 0);
    config.close();
    std::atomic<int> answers{0}, stored{0}; // outlive the host, whose plug-ins answer on threads of their own
    PluginHost host(data.path());

    const QString serverInfo = u"3CE573D25E0F455B8F75EDDC573E2B64"_s,
                  bookmarks = u"2F6394EE90434A7190D7511370AFAE17"_s;
    const char* signal = "2serverDatabasePathChanged(const QString &)";
    const char* slot = "1onServerDatabasePathChanged(const QString &)";
    PathReceiver receiver;
    IPluginManager* manager = host.GetPluginManager();
    EXPECT_NE(manager->GetPluginObject(serverInfo), nullptr);
    EXPECT_EQ(manager->GetPluginObject(u"no-such-plugin"_s), nullptr);
    EXPECT_TRUE(manager->ConnectPluginSignal(serverInfo, signal, &receiver, slot, 0));
    EXPECT_FALSE(manager->ConnectPluginSignal(u"no-such-plugin"_s, signal, &receiver, slot, 0));
    host.serverInfo().setServerDatabasePath(u"/elsewhere"_s);
    host.serverInfo().setServerDatabasePath(u"/elsewhere"_s); // unchanged: no signal
    EXPECT_EQ(receiver.paths, QStringList{u"/elsewhere"_s});

    EXPECT_EQ(host.remoteBookmarkPlugin(QString()), nullptr); // an empty name names no server
    ASSERT_NE(host.remoteBookmarkPlugin(u"east"_s), nullptr);
    const auto answer = [&](bool success, QVariant, QString code, QString, bool final) {
        stored += success && final && code == u"0"_s ? 1 : 0;
        ++answers;
    };
    const QVariantMap bookmark{{u"CameraID"_s, u"cam-1"_s}};
    IRelaySender* relay = host.GetRelaySender();
    EXPECT_FALSE(relay->RelayRequest(bookmarks, u"AddBookmark"_s, bookmark, false, u"west"_s, answer));
    EXPECT_TRUE(relay->RelayRequest(bookmarks, u"AddBookmark"_s, bookmark, false, u"east"_s, answer));
    ASSERT_TRUE(waitFor([&] { return answers > 0; }));
    EXPECT_EQ(stored, 1);
    EXPECT_EQ(host.remoteBookmarkPlugin(u"east"_s)->bookmarks().size(), 1);
    EXPECT_TRUE(host.bookmarkPlugin().bookmarks().isEmpty());
}

#include "PluginHostTest.moc"
