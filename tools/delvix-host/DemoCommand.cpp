#include "HostCommand.h"
#include "PluginHost.h"

#include <QCoreApplication>
#include <QElapsedTimer>
#include <QEventLoop>
#include <QTimer>
#include <cstdio>

namespace {

int g_demoClient = 0;

// Sends one request and prints its replies until the final one (or a short time-out).
void showCall(PluginHost& host, const char* explanation, const QString& command, const QVariant& params)
{
    std::printf("\n== %s\n   %s %s\n", explanation, qUtf8Printable(command),
                params.isValid() ? replyLine(false, QString(), QString(), params).constData() : "");
    QEventLoop loop;
    QObject context;
    HDLR_DO_REQUEST_CB reply = [&context, &loop](bool bFinal, const QString& strCode,
                                                 const QString& strMessage, const QVariant& payload) {
        const QByteArray line = replyLine(bFinal, strCode, strMessage, payload);
        QMetaObject::invokeMethod(
            &context,
            [&loop, line, bFinal]() {
                std::printf("   -> %s\n", line.constData());
                if (bFinal) {
                    loop.quit();
                }
            },
            Qt::QueuedConnection);
    };
    RequestSenderInfo sender;
    sender.strSenderName = QStringLiteral("delvix-host demo");
    sender.senderHandle = &g_demoClient;
    host.request(command, params, sender, reply);
    QTimer::singleShot(2000, &loop, &QEventLoop::quit);
    loop.exec();
}

} // namespace

int runDemo(const HostOptions& options)
{
    QElapsedTimer timer;
    timer.start();
    PluginHost host(options.dataDir);
    QString error;
    const QString module =
        options.modulePath.isEmpty() ? PluginHost::defaultModulePath() : options.modulePath;
    if (!host.load(module, &error)) {
        std::fprintf(stderr, "delvix-host: %s\n", qUtf8Printable(error));
        return 1;
    }
    std::printf("Loaded %s\nData folder: %s\n", qUtf8Printable(module), qUtf8Printable(host.dataDir()));

    showCall(host, "A command the plug-in does not know is refused", QStringLiteral("noSuchCommand"),
             QVariant());
    showCall(host, "Command names are case-sensitive", QStringLiteral("StartSearch"), QVariant());
    showCall(host, "The case list", QStringLiteral("getCaseList"), QVariant());

    host.unload();
    std::printf("\nDemo finished in %.1f s.\n", double(timer.elapsed()) / 1000.0);
    return 0;
}
