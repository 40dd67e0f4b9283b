// The whole road on the built-in site: the host loads the plug-in module, the configuration
// server announces the site's cameras, simulated cameras serve them on loopback, and the metadata
// of every recording location (the protected camera and both channels included) comes back to
// the server as "InputObjectMetaInfo" and is stored.
#include "CameraSimulator.h"
#include "NovirConfigServer.h"
#include "NovirSite.h"
#include "PluginHost.h"

#include <QCoreApplication>
#include <QDir>
#include <QElapsedTimer>
#include <QFile>
#include <QMap>
#include <QSet>
#include <QTemporaryDir>
#include <gtest/gtest.h>

namespace {

void writeFile(const QString& path, const QByteArray& content)
{
    QFile file(path);
    ASSERT_TRUE(file.open(QIODevice::WriteOnly));
    file.write(content);
}

} // namespace

TEST(DefaultSiteSync, EveryRecordingLocationOfTheSiteIsFetchedAndStored)
{
    QTemporaryDir dir;
    ASSERT_TRUE(dir.isValid());
    const QString previous = QDir::currentPath();
    QDir::setCurrent(dir.path());
    // One-second passes with no delay, so the first windows come within a second or two.
    writeFile(dir.filePath("routineSyncTimeBuffer.txt"), "1\n");
    writeFile(dir.filePath("getObjectDataTimeBuffer.txt"), "0\n");

    // One simulated camera per address of the site (the two channels share one), on free ports.
    NovirSite site = NovirSite::defaultSite();
    QMap<int, CameraSetup> byPort;
    for (const NovirCamera& camera : site.cameras) {
        CameraSetup& setup = byPort[camera.port];
        if (setup.name.isEmpty()) {
            setup.name = camera.name;
        }
        setup.user = camera.user;
        setup.password = camera.password;
        setup.protectedMetadata = setup.protectedMetadata || camera.protectCap;
        setup.channels = qMax(setup.channels, camera.channelCount);
        setup.objectsPerMinute = 600;
    }
    QSet<QString> protectedCameras;
    for (const CameraSetup& setup : byPort) {
        if (setup.protectedMetadata) {
            protectedCameras.insert(setup.name);
        }
    }
    CameraSimulator cameras;
    QString error;
    ASSERT_TRUE(cameras.start(byPort.values(), &error)) << qPrintable(error);
    for (NovirCamera& camera : site.cameras) {
        camera.port = cameras.port(byPort.value(camera.port).name);
    }

    NovirConfigServer server(site);
    ASSERT_TRUE(server.openStore(dir.filePath("Server"), &error)) << qPrintable(error);
    QSet<int> storedLocations;
    QObject context;
    QObject::connect(&server, &NovirConfigServer::metaInfoIngested, &context,
                     [&](int, int locationNumber, int objectCount) {
                         if (objectCount > 0) {
                             storedLocations.insert(locationNumber);
                         }
                     });
    server.start();
    {
        PluginHost host(dir.filePath("data"));
        host.setNovirTunnelClient(&server);
        ASSERT_TRUE(host.load(PLUGIN_MODULE_PATH, &error)) << qPrintable(error);

        // Every camera in the directory (records metadata, has a location, is online): on the
        // built-in site the protected camera and both channels of the multi-channel one among them.
        QSet<int> expected;
        for (const NovirCamera& camera : site.cameras) {
            if (camera.recordCap && !camera.location.isEmpty() && camera.online) {
                expected.insert(QString(camera.location).remove(QStringLiteral("Loc")).toInt());
            }
        }
        ASSERT_GE(expected.size(), 3);
        QElapsedTimer timer;
        timer.start();
        while (!storedLocations.contains(expected) && timer.elapsed() < 20000) {
            QCoreApplication::processEvents(QEventLoop::AllEvents, 20);
        }
        EXPECT_EQ(storedLocations, expected);
        host.unload();
    }
    EXPECT_GT(server.ingestedObjects(), 0);

    QSet<int> channels;
    bool protectedByToken = false;
    for (const ServedRequest& served : cameras.servedRequests()) {
        if (served.status == 200 && served.channel >= 0) {
            channels.insert(served.channel);
        }
        protectedByToken = protectedByToken || (protectedCameras.contains(served.camera) &&
                                                served.status == 200 && served.withAccessToken);
    }
    EXPECT_EQ(channels, (QSet<int>{0, 1}));
    EXPECT_TRUE(protectedByToken);
    QDir::setCurrent(previous);
}
