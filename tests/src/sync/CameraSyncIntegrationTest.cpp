// End to end over loopback: simulated cameras (plain, protected, multi-channel, failing, slow),
// the real HTTP client, the proxy and the synchroniser on this thread's event loop.
#include "BraskHttpClient.h"
#include "CameraSimulator.h"
#include "CameraSynchronizer.h"
#include "TestWait.h"

#include <QDateTime>
#include <QDir>
#include <QSignalSpy>
#include <QTemporaryDir>
#include <gtest/gtest.h>

TEST(CameraSyncIntegration, EveryHealthyCameraIsFetchedWhateverTheOthersDo)
{
    QTemporaryDir dir; // no settings files: defaults
    const QString previous = QDir::currentPath();
    QDir::setCurrent(dir.path());
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
    QDir::setCurrent(previous);
}
