#pragma once
// Shared pieces of the delvix-host subcommands: argument handling and reply printing.

#include <QJsonValue>
#include <QString>
#include <QStringList>
#include <QVariant>

struct HostOptions
{
    QString dataDir = QStringLiteral("./delvix-data");
    QString modulePath; // empty: the module built beside this program
    double waitSeconds = 2.0;
    double timeoutSeconds = 120.0;
    QStringList positional;
    // seed: how many objects over how many locations, and the generator's seed
    quint64 objects = 10000;
    quint32 locations = 10;
    quint32 seed = 1;
};

// Parses the options every subcommand shares (--data, --module, --wait, --timeout, and
// --objects, --locations, --seed for seed) and
// collects the rest as positional arguments. Returns false with a message on a bad option.
bool parseHostOptions(const QStringList& args, HostOptions* options, QString* error);

// One reply as the JSON line {"final", "code", "message", "payload"}; an invalid payload is null.
QByteArray replyLine(bool bFinal, const QString& strCode, const QString& strMessage, const QVariant& payload);

// Parses a command's parameter text: any JSON value (an object, or a bare number such as 5).
bool parseJsonParameter(const QString& text, QVariant* value, QString* error);

int runCall(const HostOptions& options);
int runDemo(const HostOptions& options);
int runSeed(const HostOptions& options);
// cameras: takes --site FILE besides the shared options.
int runCameras(QStringList args);
// serve: takes --site FILE and --listen ADDRESS:PORT besides the shared options.
int runServe(QStringList args);
