#include "HostCommand.h"
#include "PluginHost.h"

#include <QCoreApplication>
#include <QTimer>
#include <cstdio>

namespace {

// The sender handle of the one client this command speaks for.
int g_callClient = 0;

} // namespace

int runCall(const HostOptions& options)
{
    if (options.positional.isEmpty() || options.positional.size() > 2) {
        std::fprintf(stderr,
                     "usage: delvix-host call [--data DIR] [--wait S] [--timeout S] COMMAND [JSON]\n");
        return 2;
    }
    const QString command = options.positional.at(0);
    QVariant params;
    if (options.positional.size() == 2) {
        QString error;
        if (!parseJsonParameter(options.positional.at(1), &params, &error)) {
            std::fprintf(stderr, "delvix-host: %s\n", qUtf8Printable(error));
            return 2;
        }
    }

    PluginHost host(options.dataDir);
    QString error;
    const QString module =
        options.modulePath.isEmpty() ? PluginHost::defaultModulePath() : options.modulePath;
    if (!host.load(module, &error)) {
        std::fprintf(stderr, "delvix-host: %s\n", qUtf8Printable(error));
        return 1;
    }

    // Replies may come from any thread; print them in order on the main thread.
    bool anyReply = false;
    auto printReply = [&anyReply](bool bFinal, const QString& strCode, const QString& strMessage,
                                  const QVariant& payload) {
        anyReply = true;
        std::printf("%s\n", replyLine(bFinal, strCode, strMessage, payload).constData());
        std::fflush(stdout);
        if (bFinal) {
            QCoreApplication::exit(0);
        }
    };
    QObject context;
    HDLR_DO_REQUEST_CB reply = [&context, printReply](bool bFinal, const QString& strCode,
                                                      const QString& strMessage, const QVariant& payload) {
        QMetaObject::invokeMethod(
            &context, [=]() { printReply(bFinal, strCode, strMessage, payload); }, Qt::QueuedConnection);
    };

    RequestSenderInfo sender;
    sender.strSenderName = QStringLiteral("delvix-host call");
    sender.strSenderAddress = QStringLiteral("local");
    sender.senderHandle = &g_callClient;
    host.request(command, params, sender, reply);

    // A command that sends no reply at all ends after --wait; one that streams replies gets
    // until --timeout for its final reply.
    int exitCode = 0;
    QTimer::singleShot(qRound(options.waitSeconds * 1000), &context, [&anyReply]() {
        if (!anyReply) {
            QCoreApplication::exit(0);
        }
    });
    QTimer::singleShot(qRound(options.timeoutSeconds * 1000), &context, [&exitCode, &options]() {
        std::fprintf(stderr, "delvix-host: no final reply within %g s\n", options.timeoutSeconds);
        exitCode = 3;
        QCoreApplication::exit(3);
    });
    QCoreApplication::exec();
    host.unload();
    return exitCode;
}
