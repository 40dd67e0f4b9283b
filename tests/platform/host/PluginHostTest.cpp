// The in-process host and the plug-in module it loads: metadata, the single instance,
// refusal of foreign modules, request delivery on request threads, and the delvix-host program.

#include "PluginHost.h"

#include <QCoreApplication>
#include <QDir>
#include <QElapsedTimer>
#include <QJsonDocument>
#include <QJsonObject>
#include <QMutex>
#include <QPluginLoader>
#include <QProcess>
#include <QSet>
#include <QSettings>
#include <QTemporaryDir>
#include <QThread>
#include <gtest/gtest.h>

namespace {

const QString kModule = QStringLiteral(PLUGIN_MODULE_PATH);

// Runs the event loop until pred holds or the time is up.
template <typename Pred>
bool waitFor(Pred pred, int timeoutMs = 5000)
{
    QElapsedTimer timer;
    timer.start();
    while (!pred() && timer.elapsed() < timeoutMs) {
        QCoreApplication::processEvents(QEventLoop::AllEvents, 10);
        QThread::msleep(1);
    }
    return pred();
}

struct ProcessResult
{
    int exitCode = -1;
    QByteArray out;
    QByteArray err;
};

ProcessResult runHost(const QStringList& args)
{
    QProcess process;
    process.start(QStringLiteral(DELVIX_HOST_PATH), args);
    process.waitForFinished(30000);
    return {process.exitStatus() == QProcess::NormalExit ? process.exitCode() : -1,
            process.readAllStandardOutput(), process.readAllStandardError()};
}

// Receives the server-information plug-in's path signal through the plug-in manager.
class PathReceiver : public QObject
{
    Q_OBJECT
public:
    QStringList paths;
public slots:
    void onServerDatabasePathChanged(const QString& path) { paths << path; }
};

} // namespace

TEST(PluginModule, LoadsFromBuildTreeWithItsMetadataAndOneInstance)
{
    QPluginLoader loader(kModule);
    const QJsonObject metaData = loader.metaData();
    EXPECT_EQ(metaData.value(QStringLiteral("IID")).toString(),
              QStringLiteral("com.Quorvex.PluginServer.PluginInterface"));
    EXPECT_EQ(metaData.value(QStringLiteral("className")).toString(), QStringLiteral("PluginDelvixSrv"));
    EXPECT_EQ(
        metaData.value(QStringLiteral("MetaData")).toObject(),
        (QJsonObject{{QStringLiteral("PluginID"), QStringLiteral("d2792a6a286548ecb47417172e5e5fa7")}}));

    QObject* first = loader.instance();
    ASSERT_NE(first, nullptr) << qPrintable(loader.errorString());
    EXPECT_EQ(loader.instance(), first);
    EXPECT_NE(qobject_cast<IPluginObjectBase*>(first), nullptr);
    EXPECT_NE(first->qt_metacast("PluginDelvixSrv"), nullptr);
    EXPECT_NE(first->qt_metacast("com.Quorvex.PluginServer.PluginInterface"), nullptr);
    EXPECT_EQ(first->parent(), nullptr);
    EXPECT_TRUE(loader.unload());
}

TEST(PluginHost, RefusesForeignModulesWithAClearMessage)
{
    QTemporaryDir data;
    PluginHost host(data.path());
    QString error;
    EXPECT_FALSE(host.load(QStringLiteral(WRONG_IID_MODULE_PATH), &error));
    EXPECT_TRUE(error.contains(QStringLiteral("interface id"))) << qPrintable(error);
    EXPECT_FALSE(host.load(QStringLiteral(WRONG_ID_MODULE_PATH), &error));
    EXPECT_TRUE(error.contains(QStringLiteral("PluginID"))) << qPrintable(error);
    EXPECT_FALSE(host.load(data.filePath(QStringLiteral("missing.so")), &error));
    EXPECT_TRUE(error.contains(QStringLiteral("not found"))) << qPrintable(error);
    EXPECT_EQ(host.plugin(), nullptr);
}

TEST(PluginHost, DeliversRequestsOnRequestThreadsAndPublishesItsData)
{
    QTemporaryDir data;
    PluginHost host(data.path());
    QString error;
    ASSERT_TRUE(host.load(kModule, &error)) << qPrintable(error);
    EXPECT_EQ(host.plugin()->thread(), QThread::currentThread());

    // The server database path and the store's installation directory live in the data folder.
    EXPECT_EQ(host.serverInfo().serverDatabasePath(), QDir(data.path()).filePath(QStringLiteral("database")));
    QSettings settings(QSettings::NativeFormat, QSettings::SystemScope, QStringLiteral("Quorvex, Inc."),
                       QStringLiteral("NOVIR"));
    EXPECT_EQ(settings.value(QStringLiteral("Software/INSTALL_PATH")).toString(),
              QDir(data.path()).absolutePath());

    QMutex mutex;
    QSet<QThread*> replyThreads; // guarded by mutex
    int replies = 0;             // guarded by mutex
    constexpr int kRequests = 40;
    for (int i = 0; i < kRequests; ++i) {
        host.request(QStringLiteral("noSuchCommand"), QVariant(i), RequestSenderInfo{},
                     [&](bool bFinal, const QString& strCode, const QString&, const QVariant&) {
                         EXPECT_TRUE(bFinal);
                         EXPECT_EQ(strCode, QStringLiteral("commandNotSupportError"));
                         QMutexLocker lock(&mutex);
                         replyThreads.insert(QThread::currentThread());
                         ++replies;
                     });
    }
    host.waitForRequests();
    QMutexLocker lock(&mutex);
    EXPECT_EQ(replies, kRequests);
    EXPECT_FALSE(replyThreads.contains(QThread::currentThread()));
    lock.unlock();
    host.unload();
    EXPECT_EQ(host.plugin(), nullptr);
}

TEST(DelvixHostProgram, CallPrintsOneReplyLinePerReplyAndReportsUsageErrors)
{
    QTemporaryDir data;
    ProcessResult result = runHost(
        {QStringLiteral("call"), QStringLiteral("--data"), data.path(), QStringLiteral("noSuchCommand")});
    EXPECT_EQ(result.exitCode, 0) << result.err.constData();
    EXPECT_EQ(result.out,
              QByteArray(R"({"final":true,"code":"commandNotSupportError","message":"","payload":null})"
                         "\n"));

    // A bare number is a valid parameter.
    result = runHost({QStringLiteral("call"), QStringLiteral("--data"), data.path(), QStringLiteral("Nope"),
                      QStringLiteral("5")});
    EXPECT_EQ(result.exitCode, 0) << result.err.constData();
    EXPECT_EQ(result.out.count('\n'), 1);

    result = runHost({QStringLiteral("call"), QStringLiteral("--data"), data.path()});
    EXPECT_NE(result.exitCode, 0);
    EXPECT_TRUE(result.err.contains("usage")) << result.err.constData();

    result = runHost({QStringLiteral("call"), QStringLiteral("--data"), data.path(), QStringLiteral("x"),
                      QStringLiteral("{not json")});
    EXPECT_NE(result.exitCode, 0);
    EXPECT_TRUE(result.out.isEmpty());

    result = runHost({QStringLiteral("call"), QStringLiteral("--data"), data.path(),
                      QStringLiteral("--module"), QStringLiteral(WRONG_ID_MODULE_PATH), QStringLiteral("x")});
    EXPECT_NE(result.exitCode, 0);
    EXPECT_TRUE(result.err.contains("PluginID")) << result.err.constData();

    result = runHost({QStringLiteral("frobnicate")});
    EXPECT_NE(result.exitCode, 0);
    result = runHost({QStringLiteral("call"), QStringLiteral("--bogus"), QStringLiteral("x")});
    EXPECT_NE(result.exitCode, 0);
}

TEST(PluginHost, PluginManagerConnectsPluginSignalsAndRelayRefusesUnknownPaths)
{
    QTemporaryDir data;
    PluginHost host(data.path());
    PathReceiver receiver;
    IPluginManager* manager = host.GetPluginManager();
    ASSERT_NE(manager->GetPluginObject(QStringLiteral("3CE573D25E0F455B8F75EDDC573E2B64")), nullptr);
    EXPECT_EQ(manager->GetPluginObject(QStringLiteral("no-such-plugin")), nullptr);
    EXPECT_TRUE(manager->ConnectPluginSignal(QStringLiteral("3CE573D25E0F455B8F75EDDC573E2B64"),
                                             "2serverDatabasePathChanged(const QString &)", &receiver,
                                             "1onServerDatabasePathChanged(const QString &)", 0));
    EXPECT_FALSE(manager->ConnectPluginSignal(QStringLiteral("no-such-plugin"),
                                              "2serverDatabasePathChanged(const QString &)", &receiver,
                                              "1onServerDatabasePathChanged(const QString &)", 0));
    EXPECT_FALSE(manager->ConnectPluginSignal(QStringLiteral("3CE573D25E0F455B8F75EDDC573E2B64"),
                                              "2noSuchSignal()", &receiver,
                                              "1onServerDatabasePathChanged(const QString &)", 0));
    host.serverInfo().setServerDatabasePath(QStringLiteral("/elsewhere"));
    host.serverInfo().setServerDatabasePath(QStringLiteral("/elsewhere")); // unchanged: no signal
    EXPECT_EQ(receiver.paths, QStringList{QStringLiteral("/elsewhere")});

    bool answered = false;
    EXPECT_FALSE(host.GetRelaySender()->RelayRequest(
        QStringLiteral("2F6394EE90434A7190D7511370AFAE17"), QStringLiteral("AddBookmark"), QVariant(), false,
        QStringLiteral("unknown-server"),
        [&answered](bool, QVariant, QString, QString, bool) { answered = true; }));
    EXPECT_FALSE(answered);
}

#include "PluginHostTest.moc"
