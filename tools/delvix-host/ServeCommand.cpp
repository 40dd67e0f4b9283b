// delvix-host serve: the long-running host with the local HTTP API (HostHttpApi.h), on the
// built-in site or a site file (its cameras simulated on free loopback ports), until interrupted.
#include "HostCommand.h"
#include "HostHttpApi.h"
#include "PluginHost.h"
#include "SiteRunner.h"

#include <QCoreApplication>
#include <QDir>
#include <QSocketNotifier>
#include <QTimer>
#include <csignal>
#include <cstdio>
#include <unistd.h>
#ifdef __GLIBC__
#include <malloc.h>
#endif

namespace {

int g_signalPipe[2] = {-1, -1};

void onTerminate(int)
{
    const char byte = 1;
    [[maybe_unused]] const ssize_t written = ::write(g_signalPipe[1], &byte, 1);
}

bool takeOption(QStringList& args, const QString& name, QString* value, QString* error)
{
    const int index = args.indexOf(name);
    if (index < 0) {
        return true;
    }
    if (index + 1 >= args.size()) {
        *error = QStringLiteral("%1 needs a value").arg(name);
        return false;
    }
    *value = args.at(index + 1);
    args.remove(index, 2);
    return true;
}

} // namespace

int runServe(QStringList args)
{
    QString siteFile;
    QString listen = QStringLiteral("127.0.0.1:8765");
    QString error;
    HostOptions options;
    if (!takeOption(args, QStringLiteral("--site"), &siteFile, &error) ||
        !takeOption(args, QStringLiteral("--listen"), &listen, &error) ||
        !parseHostOptions(args, &options, &error) || !options.positional.isEmpty()) {
        std::fprintf(stderr, "delvix-host serve: %s\n",
                     qUtf8Printable(error.isEmpty()
                                        ? QStringLiteral("unexpected argument ") + options.positional.first()
                                        : error));
        return 2;
    }
    const int colon = listen.lastIndexOf(QLatin1Char(':'));
    bool portOk = false;
    const uint port = colon > 0 ? listen.mid(colon + 1).toUInt(&portOk) : 0;
    const QHostAddress address(colon > 0 ? listen.left(colon) : QString());
    if (!portOk || port > 65535 || address.isNull()) {
        std::fprintf(stderr, "delvix-host serve: --listen wants ADDRESS:PORT, such as 127.0.0.1:8765\n");
        return 2;
    }

    NovirSite site = NovirSite::defaultSite();
    if (!siteFile.isEmpty() && !NovirSite::fromFile(siteFile, &site, &error)) {
        std::fprintf(stderr, "delvix-host serve: %s\n", qUtf8Printable(error));
        return 1;
    }
    // Declared before the host: the plug-in's handlers must never outlive the server. The
    // cameras run too, so that the synchroniser has real answers to fetch.
    SiteRunner runner(site);
    if (!runner.start(QDir(options.dataDir).filePath(QStringLiteral("Server")), 6, &error)) {
        std::fprintf(stderr, "delvix-host serve: the site did not start: %s\n", qUtf8Printable(error));
        return 1;
    }
    PluginHost host(options.dataDir);
    host.setNovirTunnelClient(&runner.server());
    const QString module =
        options.modulePath.isEmpty() ? PluginHost::defaultModulePath() : options.modulePath;
    if (!host.load(module, &error)) {
        std::fprintf(stderr, "delvix-host: %s\n", qUtf8Printable(error));
        return 1;
    }
    HostHttpApi api(&host);
    api.setSite(runner.site());
    if (!api.listenOn(address, quint16(port), &error)) {
        std::fprintf(stderr, "delvix-host serve: %s\n", qUtf8Printable(error));
        host.unload();
        return 1;
    }

    // SIGINT and SIGTERM end the event loop through a pipe, so shutdown runs on the main thread.
    if (::pipe(g_signalPipe) == 0) {
        std::signal(SIGINT, onTerminate);
        std::signal(SIGTERM, onTerminate);
    }
    QSocketNotifier notifier(g_signalPipe[0], QSocketNotifier::Read);
    QObject::connect(&notifier, &QSocketNotifier::activated, []() { QCoreApplication::quit(); });

    // glibc hands back to the system only the free memory at the top of each heap. Answers' buffers
    // come and go between long-lived blocks (the case map, the databases' caches), so the holes
    // they leave stay resident, and a server that runs for months would ratchet up by them.
    // Trimming now and then returns every free page; it takes a millisecond or two here.
#ifdef __GLIBC__
    QTimer trim;
    QObject::connect(&trim, &QTimer::timeout, []() { malloc_trim(0); });
    trim.start(2000);
#endif

    std::printf("delvix-host serving on http://%s:%u (data %s, site %s); open the address in a browser "
                "for the explorer; Ctrl-C to stop\n",
                qUtf8Printable(address.toString()), unsigned(api.port()), qUtf8Printable(host.dataDir()),
                qUtf8Printable(siteFile.isEmpty() ? QStringLiteral("built in") : siteFile));
    std::fflush(stdout);
    QCoreApplication::exec();
    std::printf("delvix-host: stopping after %d request(s)\n", api.requestsServed());
    host.unload();
    return 0;
}
