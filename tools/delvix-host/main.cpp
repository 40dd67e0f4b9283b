// delvix-host: the development host. Loads the plug-in module and drives it the way the
// management server does. See README.md for the subcommands.

#include "HostCommand.h"

#include <QCoreApplication>
#include <cstdio>

namespace {

void printUsage(std::FILE* out)
{
    std::fprintf(
        out, "usage: delvix-host SUBCOMMAND [--data DIR] [--module PATH] ...\n"
             "  call COMMAND [JSON]   send one request, print each reply as a JSON line\n"
             "                        [--wait S] end after S s when no reply came (default 2)\n"
             "                        [--timeout S] give up waiting for the final reply (default 120)\n"
             "  demo                  load the plug-in and show what it does\n"
             "  seed                  fill the data folder's store (DIR/Server) with synthetic objects\n"
             "                        [--objects N] (default 10000) [--locations L] (default 10)\n"
             "                        [--seed S] (default 1)\n"
             "  cameras [--site FILE] start the configuration-server simulator on a site (default:\n"
             "                        a built-in one) and print the camera directory the plug-in learned\n"
             "  serve [--site FILE] [--listen 127.0.0.1:PORT]\n"
             "                        run the host with its local HTTP API (default port 8765)\n"
             "  --data DIR            the host's data folder (default ./delvix-data)\n");
}

} // namespace

int main(int argc, char* argv[])
{
    QCoreApplication app(argc, argv);
    QStringList args = QCoreApplication::arguments();
    args.removeFirst();
    if (args.isEmpty() || args.first() == QLatin1String("--help") || args.first() == QLatin1String("-h")) {
        printUsage(args.isEmpty() ? stderr : stdout);
        return args.isEmpty() ? 2 : 0;
    }
    const QString subcommand = args.takeFirst();
    if (subcommand == QLatin1String("cameras")) {
        return runCameras(args);
    }
    if (subcommand == QLatin1String("serve")) {
        return runServe(args);
    }
    HostOptions options;
    QString error;
    if (!parseHostOptions(args, &options, &error)) {
        std::fprintf(stderr, "delvix-host %s: %s\n", qUtf8Printable(subcommand), qUtf8Printable(error));
        printUsage(stderr);
        return 2;
    }
    if (subcommand == QLatin1String("call")) {
        return runCall(options);
    }
    if (subcommand == QLatin1String("demo")) {
        if (!options.positional.isEmpty()) {
            std::fprintf(stderr, "delvix-host demo: unexpected argument %s\n",
                         qUtf8Printable(options.positional.first()));
            return 2;
        }
        return runDemo(options);
    }
    if (subcommand == QLatin1String("seed")) {
        return runSeed(options);
    }
    std::fprintf(stderr, "delvix-host: unknown subcommand %s\n", qUtf8Printable(subcommand));
    printUsage(stderr);
    return 2;
}
