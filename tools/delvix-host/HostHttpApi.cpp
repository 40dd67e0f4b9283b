#include "HostHttpApi.h"

#include "HostCommand.h"
#include "PluginHost.h"

#include <QDir>
#include <QFile>
#include <QFileInfo>
#include <QHttpServerRequest>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QRegularExpression>
#include <QStringList>
#include <QTcpSocket>
#include <QTimer>
#include <QUrlQuery>
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
// From the sanitizer's run-time library (its header is not always installed).
extern "C" size_t __sanitizer_get_current_allocated_bytes();
#elif defined(__GLIBC__)
#include <malloc.h>
#endif

namespace {

// What the process holds: its anonymous resident memory, and the bytes its live allocations take
// (a sanitizer's allocator counts its own; an allocator's free lists are not counted).
QByteArray memoryReport()
{
    qint64 rssAnonKb = -1;
    QFile status(QStringLiteral("/proc/self/status"));
    if (status.open(QIODevice::ReadOnly)) {
        for (const QByteArray& line : status.readAll().split('\n')) {
            if (line.startsWith("RssAnon:")) {
                rssAnonKb = line.mid(8).simplified().split(' ').value(0).toLongLong();
            }
        }
    }
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    const qint64 heapBytes = qint64(__sanitizer_get_current_allocated_bytes());
#elif defined(__GLIBC__)
    const struct mallinfo2 info = mallinfo2();
    const qint64 heapBytes = qint64(info.uordblks + info.hblkhd);
#else
    const qint64 heapBytes = -1;
#endif
    const QJsonObject report{{"rssAnonKb", double(rssAnonKb)}, {"heapBytes", double(heapBytes)}};
    return QJsonDocument(report).toJson(QJsonDocument::Compact) + '\n';
}

QByteArray reasonPhrase(int status)
{
    switch (status) {
    case 200:
        return "OK";
    case 400:
        return "Bad Request";
    case 404:
        return "Not Found";
    case 405:
        return "Method Not Allowed";
    default:
        return "Error";
    }
}

void writeChunk(QTcpSocket* socket, const QByteArray& data)
{
    socket->write(QByteArray::number(data.size(), 16) + "\r\n" + data + "\r\n");
}

// Ends one streamed answer: the closing chunk, then the connection.
void finishStream(QTcpSocket* socket)
{
    socket->write("0\r\n\r\n");
    socket->disconnectFromHost();
}

// How long an answer waits for the final reply of a command that does reply.
constexpr double kFinalReplyLimitSeconds = 600.0;

// The commands that never answer, and the add commands whose item list is empty (no batch).
bool sendsNoReply(const QString& command, const QVariant& params)
{
    static const QStringList silent{QStringLiteral("stopSearch"), QStringLiteral("stopReIdSearch"),
                                    QStringLiteral("retrieveDelvixData")};
    if (silent.contains(command)) {
        return true;
    }
    if (command == QLatin1String("addCaseWithRecordings") ||
        command == QLatin1String("addCaseItemFromRecordings")) {
        return params.toMap().value(QStringLiteral("caseItem")).toList().isEmpty();
    }
    return false;
}

} // namespace

HostHttpApi::HostHttpApi(PluginHost* host, QObject* parent)
    : QAbstractHttpServer(parent)
    , m_host(host)
{}

bool HostHttpApi::listenOn(const QHostAddress& address, quint16 port, QString* error)
{
    if (!address.isLoopback()) {
        *error = QStringLiteral("%1 is not a loopback address; the API listens on this machine only")
                     .arg(address.toString());
        return false;
    }
    m_port = listen(address, port);
    if (m_port == 0) {
        *error =
            QStringLiteral("cannot listen on %1:%2 (is the port in use?)").arg(address.toString()).arg(port);
        return false;
    }
    return true;
}

void HostHttpApi::writeSimple(QTcpSocket* socket, int status, const QByteArray& contentType,
                              const QByteArray& body)
{
    socket->write("HTTP/1.1 " + QByteArray::number(status) + ' ' + reasonPhrase(status) +
                  "\r\nContent-Type: " + contentType + "\r\nContent-Length: " +
                  QByteArray::number(body.size()) + "\r\nConnection: close\r\n\r\n" + body);
    socket->disconnectFromHost();
}

void HostHttpApi::missingHandler(const QHttpServerRequest&, QTcpSocket* socket)
{
    writeSimple(socket, 404, "text/plain", "not found\n");
}

bool HostHttpApi::serveExplorer(const QString& path, QTcpSocket* socket)
{
    // Only plain file names of the built-in folder: nothing outside it can be named.
    static const QRegularExpression fileName(QStringLiteral("^/explorer/([A-Za-z0-9_-]+\\.(js|css|png))$"));
    const QRegularExpressionMatch match = fileName.match(path);
    QString resource;
    if (path == QLatin1String("/") || path == QLatin1String("/index.html")) {
        resource = QStringLiteral(":/explorer/index.html");
    } else if (match.hasMatch()) {
        resource = QStringLiteral(":/explorer/") + match.captured(1);
    } else {
        return false;
    }
    QFile file(resource);
    if (!file.open(QIODevice::ReadOnly)) {
        writeSimple(socket, 404, "text/plain", "not found\n");
        return true;
    }
    static const QHash<QString, QByteArray> types{{QStringLiteral("html"), "text/html; charset=utf-8"},
                                                  {QStringLiteral("js"), "text/javascript; charset=utf-8"},
                                                  {QStringLiteral("css"), "text/css; charset=utf-8"},
                                                  {QStringLiteral("png"), "image/png"}};
    const QByteArray body = file.readAll();
    // The page may load from this host only; images come inline as data: addresses.
    socket->write("HTTP/1.1 200 OK\r\nContent-Type: " + types.value(QFileInfo(resource).suffix()) +
                  "\r\nContent-Security-Policy: default-src 'self'; img-src 'self' data:\r\n"
                  "Cache-Control: no-cache\r\nContent-Length: " +
                  QByteArray::number(body.size()) + "\r\nConnection: close\r\n\r\n" + body);
    socket->disconnectFromHost();
    return true;
}

QByteArray HostHttpApi::camerasReport() const
{
    QVariantMap directory;
    if (m_host->plugin()) {
        QMetaObject::invokeMethod(m_host->plugin(), "cameraDirectory", Qt::DirectConnection,
                                  Q_RETURN_ARG(QVariantMap, directory));
    }
    QJsonArray cameras;
    for (auto it = directory.cbegin(); it != directory.cend(); ++it) {
        const QVariantMap record = it.value().toMap();
        cameras.append(QJsonObject{{"name", it.key()},
                                   {"location", record.value(QStringLiteral("Location")).toString()},
                                   {"group", record.value(QStringLiteral("GroupID")).toInt()},
                                   {"recording", record.value(QStringLiteral("IsRecording")).toBool()},
                                   {"protected", record.value(QStringLiteral("DelvixProtect")).toBool()},
                                   {"online", true}});
    }
    // The directory holds only cameras that record, have a location and are online.
    QJsonArray left;
    for (const NovirCamera& camera : m_site.cameras) {
        if (directory.contains(camera.name)) {
            continue;
        }
        const QString reasons = NovirSite::exclusionReasons(camera);
        left.append(
            QJsonObject{{"name", camera.name},
                        {"location", camera.location},
                        {"online", camera.online},
                        {"reason", reasons.isEmpty() ? QStringLiteral("not announced yet") : reasons}});
    }
    const QJsonObject report{
        {"cameras", cameras}, {"notInDirectory", left}, {"vocabulary", m_site.vocabulary.toJson()}};
    return QJsonDocument(report).toJson(QJsonDocument::Compact) + '\n';
}

bool HostHttpApi::handleRequest(const QHttpServerRequest& request, QTcpSocket* socket)
{
    const QString path = request.url().path();
    if (path == QLatin1String("/health")) {
        writeSimple(socket, 200, "application/json", "{\"ok\":true}\n");
        return true;
    }
    if (path == QLatin1String("/host/memory")) {
        writeSimple(socket, 200, "application/json", memoryReport());
        return true;
    }
    if (request.method() == QHttpServerRequest::Method::Get) {
        if (path == QLatin1String("/host/cameras")) {
            writeSimple(socket, 200, "application/json", camerasReport());
            return true;
        }
        if (serveExplorer(path, socket)) {
            return true;
        }
    }
    if (request.method() != QHttpServerRequest::Method::Post) {
        writeSimple(socket, 405, "text/plain", "use POST /request or POST /COMMAND\n");
        return true;
    }

    if (path == QLatin1String("/host/databasePath")) {
        changeDatabasePath(request.body(), socket);
        return true;
    }

    QString command;
    QVariant params;
    QString client = QUrlQuery(request.url()).queryItemValue(QStringLiteral("client"));
    if (client.isEmpty()) {
        client = QString::fromUtf8(request.value("X-Client"));
    }
    double waitSeconds = 2.0;
    const QByteArray body = request.body().trimmed();
    if (path == QLatin1String("/request")) {
        QJsonParseError parseError{};
        const QJsonDocument document = QJsonDocument::fromJson(body, &parseError);
        if (!document.isObject()) {
            writeSimple(socket, 400, "text/plain",
                        "the body must be a JSON object {\"command\", \"params\", \"client\", \"wait\"}: " +
                            parseError.errorString().toUtf8() + '\n');
            return true;
        }
        const QJsonObject envelope = document.object();
        command = envelope.value(QStringLiteral("command")).toString();
        params = envelope.value(QStringLiteral("params")).toVariant();
        if (envelope.contains(QStringLiteral("client"))) {
            client = envelope.value(QStringLiteral("client")).toString();
        }
        waitSeconds = envelope.value(QStringLiteral("wait")).toDouble(waitSeconds);
    } else {
        command = path.mid(1);
        if (!body.isEmpty()) {
            QString error;
            if (!parseJsonParameter(QString::fromUtf8(body), &params, &error)) {
                writeSimple(socket, 400, "text/plain", error.toUtf8() + '\n');
                return true;
            }
        }
    }
    if (command.isEmpty()) {
        writeSimple(socket, 400, "text/plain", "no command given\n");
        return true;
    }
    dispatch(socket, command, params, client, qBound(0.0, waitSeconds, 3600.0));
    return true;
}

void HostHttpApi::changeDatabasePath(const QByteArray& body, QTcpSocket* socket)
{
    const QJsonObject object = QJsonDocument::fromJson(body).object();
    const QString path = object.value(QStringLiteral("path")).toString();
    if (path.isEmpty()) {
        writeSimple(socket, 400, "text/plain", "the body must be {\"path\": FOLDER}\n");
        return;
    }
    // The server makes its database folder before it announces it, as the host does at start;
    // the plug-in then moves its vault there.
    if (!QDir().mkpath(path)) {
        writeSimple(socket, 400, "text/plain", "cannot make the folder " + path.toUtf8() + '\n');
        return;
    }
    m_host->serverInfo().setServerDatabasePath(QDir(path).absolutePath());
    const QJsonObject answer{{QStringLiteral("path"), m_host->serverInfo().serverDatabasePath()}};
    writeSimple(socket, 200, "application/json", QJsonDocument(answer).toJson(QJsonDocument::Compact) + '\n');
}

std::shared_ptr<int> HostHttpApi::senderHandle(const QString& client)
{
    std::shared_ptr<int> handle = m_clients.value(client).lock();
    if (handle) {
        return handle;
    }
    if (m_clients.size() >= m_clientsPruneAt) {
        m_clients.removeIf([](const auto& entry) { return entry.value().expired(); });
        m_clientsPruneAt = qMax<qsizetype>(64, 2 * m_clients.size());
    }
    handle = std::make_shared<int>(0);
    m_clients.insert(client, handle);
    return handle;
}

void HostHttpApi::dispatch(QTcpSocket* socket, const QString& command, const QVariant& params,
                           const QString& client, double waitSeconds)
{
    ++m_requestsServed;
    socket->write("HTTP/1.1 200 OK\r\nContent-Type: application/x-ndjson\r\nTransfer-Encoding: chunked\r\n"
                  "Connection: close\r\n\r\n");

    // State of this one answer, on the main thread; replies from any thread are queued to it.
    struct Stream
    {
        QPointer<QTcpSocket> socket;
        std::shared_ptr<int> client; // the sender handle, held while the answer is open
        bool anyReply = false;
        bool finished = false;
    };
    auto stream = std::make_shared<Stream>();
    stream->socket = socket;
    stream->client = senderHandle(client);
    QPointer<HostHttpApi> self(this);

    HDLR_DO_REQUEST_CB reply = [self, stream](bool bFinal, const QString& strCode, const QString& strMessage,
                                              const QVariant& payload) {
        const QByteArray line = replyLine(bFinal, strCode, strMessage, payload) + '\n';
        if (!self) {
            return;
        }
        QMetaObject::invokeMethod(
            self.data(),
            [stream, line, bFinal]() {
                if (stream->finished) {
                    return; // a reply after the final one has nowhere to go
                }
                stream->anyReply = true;
                if (stream->socket) {
                    writeChunk(stream->socket, line);
                }
                if (bFinal) {
                    stream->finished = true;
                    if (stream->socket) {
                        finishStream(stream->socket);
                    }
                }
            },
            Qt::QueuedConnection);
    };
    // Only a command that sends no reply ends after the short wait; a search queued behind
    // others may take longer than that before its first hit, and must not lose its hits.
    const double limitSeconds = sendsNoReply(command, params) ? waitSeconds : kFinalReplyLimitSeconds;
    // The limit belongs to the connection: it goes with the socket once the answer has ended,
    // instead of holding the answer's state for the whole limit after every request.
    auto* limit = new QTimer(socket);
    limit->setSingleShot(true);
    connect(limit, &QTimer::timeout, socket, [stream]() {
        if (!stream->finished) {
            stream->finished = true;
            if (stream->socket) {
                finishStream(stream->socket);
            }
        }
    });
    limit->start(qRound(limitSeconds * 1000));

    RequestSenderInfo sender;
    sender.strSenderName = client;
    sender.strSenderAddress = socket->peerAddress().toString();
    sender.senderHandle = stream->client.get();
    m_host->request(command, params, sender, reply);
}
