// delvix-host cameras: starts the configuration-server simulator on a site, loads the plug-in
// on it, and prints the camera directory the plug-in learned through the tunnel.
#include "HostCommand.h"
#include "NovirConfigServer.h"
#include "PluginHost.h"

#include <QCoreApplication>
#include <QDeadlineTimer>
#include <QDir>
#include <QElapsedTimer>
#include <QThread>
#include <cstdio>

namespace {

QVariantMap askDirectory(PluginHost& host)
{
    QVariantMap directory;
    if (host.plugin()) {
        QMetaObject::invokeMethod(host.plugin(), "cameraDirectory", Qt::DirectConnection,
                                  Q_RETURN_ARG(QVariantMap, directory));
    }
    return directory;
}

// Runs the event loop until the server has answered the directory's three requests and the
// directory stayed the same for a moment (the announcements travel through queued signals).
QVariantMap settledDirectory(PluginHost& host, NovirConfigServer& server, double timeoutSeconds)
{
    QDeadlineTimer deadline(qint64(timeoutSeconds * 1000));
    QElapsedTimer stable;
    stable.start();
    QVariantMap last = askDirectory(host);
    while (!deadline.hasExpired()) {
        QCoreApplication::processEvents(QEventLoop::AllEvents, 20);
        QThread::msleep(5);
        const QVariantMap now = askDirectory(host);
        if (now != last) {
            last = now;
            stable.restart();
        }
        const bool answered = server.answeredCount(QStringLiteral("GetNodeInfo")) > 0 &&
                              server.answeredCount(QStringLiteral("QryLocs")) > 0 &&
                              server.answeredCount(QStringLiteral("SubCamStatus")) > 0;
        if (answered && stable.elapsed() >= 300) {
            break;
        }
    }
    return last;
}

} // namespace

int runCameras(QStringList args)
{
    QString siteFile;
    const int siteIndex = args.indexOf(QStringLiteral("--site"));
    if (siteIndex >= 0) {
        if (siteIndex + 1 >= args.size()) {
            std::fprintf(stderr, "delvix-host cameras: --site needs a file\n");
            return 2;
        }
        siteFile = args.at(siteIndex + 1);
        args.remove(siteIndex, 2);
    }
    HostOptions options;
    QString error;
    if (!parseHostOptions(args, &options, &error) || !options.positional.isEmpty()) {
        std::fprintf(stderr, "delvix-host cameras: %s\n",
                     qUtf8Printable(error.isEmpty()
                                        ? QStringLiteral("unexpected argument ") + options.positional.first()
                                        : error));
        return 2;
    }

    NovirSite site = NovirSite::defaultSite();
    if (!siteFile.isEmpty() && !NovirSite::fromFile(siteFile, &site, &error)) {
        std::fprintf(stderr, "delvix-host cameras: %s\n", qUtf8Printable(error));
        return 1;
    }
    // Declared before the host: the plug-in's handlers must never outlive the server.
    NovirConfigServer server(site);
    if (!server.openStore(QDir(options.dataDir).filePath(QStringLiteral("Server")), &error)) {
        std::fprintf(stderr, "delvix-host cameras: metadata will not be stored: %s\n", qUtf8Printable(error));
    }
    server.start();
    PluginHost host(options.dataDir);
    host.setNovirTunnelClient(&server);
    const QString module =
        options.modulePath.isEmpty() ? PluginHost::defaultModulePath() : options.modulePath;
    if (!host.load(module, &error)) {
        std::fprintf(stderr, "delvix-host: %s\n", qUtf8Printable(error));
        return 1;
    }
    const QVariantMap directory = settledDirectory(host, server, options.timeoutSeconds);

    std::printf("Site %s (%s): %lld camera entries\n",
                qUtf8Printable(siteFile.isEmpty() ? QStringLiteral("built in") : siteFile),
                qUtf8Printable(site.serverId), static_cast<long long>(site.cameras.size()));
    std::printf("\nCamera directory learned by the plug-in: %lld camera(s)\n",
                static_cast<long long>(directory.size()));
    std::printf("  %-16s %-22s %-8s %-5s %-9s %-9s %s\n", "camera", "address", "location", "group",
                "recording", "protected", "channel");
    for (auto it = directory.cbegin(); it != directory.cend(); ++it) {
        const QVariantMap record = it.value().toMap();
        const QString address =
            QStringLiteral("%1:%2%3")
                .arg(record.value(QStringLiteral("IP")).toString())
                .arg(record.value(QStringLiteral("Port")).toInt())
                .arg(record.value(QStringLiteral("UseSSL")).toBool() ? QStringLiteral(" https") : QString());
        const QVariant channel = record.value(QStringLiteral("MultiChannelID"));
        std::printf("  %-16s %-22s %-8s %-5d %-9s %-9s %s\n", qUtf8Printable(it.key()),
                    qUtf8Printable(address),
                    qUtf8Printable(record.value(QStringLiteral("Location")).toString()),
                    record.value(QStringLiteral("GroupID")).toInt(),
                    record.value(QStringLiteral("IsRecording")).toBool() ? "yes" : "no",
                    record.value(QStringLiteral("DelvixProtect")).toBool() ? "yes" : "no",
                    channel.isValid() ? qUtf8Printable(QString::number(channel.toInt())) : "-");
    }
    QStringList left;
    for (const NovirCamera& camera : site.cameras) {
        if (!directory.contains(camera.name)) {
            left << QStringLiteral("  %1: %2").arg(camera.name, NovirSite::exclusionReasons(camera));
        }
    }
    if (!left.isEmpty()) {
        std::printf("\nNot in the directory:\n%s\n", qUtf8Printable(left.join(QLatin1Char('\n'))));
    }
    host.unload();
    return 0;
}
