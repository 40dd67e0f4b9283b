// End to end over loopback: simulated cameras (plain, protected, multi-channel, failing, slow),
// the real HTTP client, the proxy and the synchroniser on this thread's event loop.
#include "BraskHttpClient.h"
#include "CameraSimulator.h"
#include "CameraSynchronizer.h"

#include <QCoreApplication>
#include <QDateTime>
#include <QDir>
#include <QElapsedTimer>
#include <QSignalSpy>
#include <QTemporaryDir>
#include <gtest/gtest.h>

namespace {

bool waitFor(const std::function<bool()>& condition, int limitMs = 15000)
{
    QElapsedTimer timer;
    timer.start();
    while (!condition() && timer.elapsed() < limitMs) {
        QCoreApplication::processEvents(QEventLoop::AllEvents, 10);
    }
    return condition();
}

CameraSetup camera(const char* name)
{
    CameraSetup setup;
    setup.name = QString::fromLatin1(name);
    setup.password = QStringLiteral("pa:ss");
    setup.objectsPerMinute = 20;
    return setup;
}

} // namespace

TEST(CameraSyncIntegration, EveryHealthyCameraIsFetchedWhateverTheOthersDo)
{
    QTemporaryDir dir; // no settings files: defaults
    const QString previous = QDir::currentPath();
    QDir::setCurrent(dir.path());

    CameraSetup vault = camera("vault");
    vault.protectedMetadata = true;
    vault.useSSL = true;
    CameraSetup yard = camera("yard");
    yard.channels = 2;
    yard.digestAuth = true;
    CameraSimulator cameras;
    ASSERT_TRUE(cameras.start({camera("door"), vault, yard, camera("broken"), camera("sluggish")}));
    cameras.setFailing("broken", true);
    // Far slower than the test: it can only hold others up, never answer before them.
    cameras.setSlow("sluggish", 60000);

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
    const QStringList healthy{"door", "vault", "yard-c0", "yard-c1"};
    ASSERT_TRUE(waitFor([&] { return answers.size() >= 4; }));
    EXPECT_TRUE(waitFor([&] { return failures.size() == 1; }));
    EXPECT_EQ(failures[0][0].toString(), "broken");
    EXPECT_FALSE(sync.getLastSyncMap().contains("sluggish"));

    QStringList answered;
    for (const QList<QVariant>& answer : answers) {
        const QVariantMap record = answer[0].toMap();
        const QString name = record.value("Name").toString();
        answered << name;
        const unsigned int end = answer[1].toUInt();
        EXPECT_GE(qint64(end), now - 180);
        EXPECT_LE(qint64(end), now - 180 + 5);
        const QVariantMap data = answer[2].toMap();
        const QString source = record.contains("MultiChannelID")
                                   ? QStringLiteral("yard/c") + record.value("MultiChannelID").toString()
                                   : name;
        EXPECT_EQ(data.value("count").toInt(), cameras.generator().objectCount(source, end - 60, end, 20))
            << qPrintable(name);
        EXPECT_TRUE(data.value("data").toByteArray().startsWith("{\"ObjectMetaInfo\":["));
        EXPECT_EQ(sync.getLastSyncMap().value(name).toUInt(), end);
    }
    answered.sort();
    EXPECT_EQ(answered, healthy);

    // The protected camera was asked on the token path and let the request in.
    bool vaultByToken = false;
    for (const ServedRequest& served : cameras.servedRequests()) {
        if (served.camera == "vault" && served.status == 200 && served.withAccessToken) {
            vaultByToken = true;
        }
    }
    EXPECT_TRUE(vaultByToken);

    EXPECT_FALSE(sync.getLastSyncMap().contains("broken"));
    EXPECT_EQ(answers.size(), 4); // the slow camera's request is still out; it ends with the proxy

    QDir::setCurrent(previous);
}
