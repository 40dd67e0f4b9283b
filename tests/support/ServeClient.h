#pragma once
// Drives `delvix-host serve` as a separate process on a free loopback port: posts to its HTTP API
// and reads the streamed JSON lines, stops it with SIGTERM or kills it; and reads a case vault the
// way a person checks it afterwards. A connection belongs to the thread that made it.

#include "TestWait.h"

#include <QFile>
#include <QHash>
#include <QJsonDocument>
#include <QJsonObject>
#include <QNetworkAccessManager>
#include <QNetworkReply>
#include <QProcess>
#include <QRegularExpression>
#include <QSqlDatabase>
#include <QSqlError>
#include <QSqlQuery>
#include <QThread>
#include <csignal>
#include <functional>
#include <memory>
#include <vector>

// One answer of the API, filled as its lines arrive; the final line is the last.
struct ServeAnswer
{
    bool done = false;
    int status = 0;
    QNetworkReply::NetworkError error = QNetworkReply::NoError;
    QList<QJsonObject> lines;

    int finalCount() const
    {
        return int(std::count_if(lines.cbegin(), lines.cend(), [](auto& l) { return l["final"].toBool(); }));
    }
    QString code() const { return finalCount() ? lines.last()["code"].toString() : QString(); }
    QJsonValue payload() const { return finalCount() ? lines.last()["payload"] : QJsonValue(); }
};
using ServeAnswerPtr = std::shared_ptr<ServeAnswer>;

class ServeConnection
{
public:
    explicit ServeConnection(quint16 port)
        : m_port(port)
    {}

    // The answer fills in while this thread's event loop turns.
    ServeAnswerPtr post(const QString& path, const QByteArray& body)
    {
        QNetworkRequest request(QUrl(QStringLiteral("http://127.0.0.1:%1%2").arg(m_port).arg(path)));
        request.setHeader(QNetworkRequest::ContentTypeHeader, "application/json");
        // Generous: an answer still open after this is a lost reply, not a slow one.
        request.setTransferTimeout(scaledMs(120000));
        auto answer = std::make_shared<ServeAnswer>();
        QNetworkReply* reply = m_network.post(request, body);
        // Lines are taken as they come: when the server dies, what arrived is what the client was told.
        auto take = [answer, reply](bool all) {
            while (reply->canReadLine() || (all && reply->bytesAvailable() > 0)) {
                if (const QByteArray line = reply->readLine().trimmed(); !line.isEmpty()) {
                    answer->lines << QJsonDocument::fromJson(line).object();
                }
            }
        };
        QObject::connect(reply, &QNetworkReply::readyRead, reply, [take]() { take(false); });
        QObject::connect(reply, &QNetworkReply::finished, reply, [answer, reply, take]() {
            take(true);
            answer->status = reply->attribute(QNetworkRequest::HttpStatusCodeAttribute).toInt();
            answer->error = reply->error();
            answer->done = true;
            reply->deleteLater();
        });
        return answer;
    }
    // POST /request; `wait` is how long the API waits for a first reply.
    ServeAnswerPtr request(const QString& command, const QJsonValue& params, const QString& client,
                           double wait = 60.0)
    {
        const QJsonObject envelope{
            {"command", command}, {"client", client}, {"params", params}, {"wait", wait}};
        return post("/request", QJsonDocument(envelope).toJson(QJsonDocument::Compact));
    }
    ServeAnswer call(const QString& command, const QJsonValue& params, const QString& client = "test",
                     double wait = 60.0)
    {
        const ServeAnswerPtr answer = request(command, params, client, wait);
        ServeConnection::wait(answer);
        return *answer;
    }
    // The transfer timeout ends every answer; this limit only guards against a stuck loop.
    static bool wait(const ServeAnswerPtr& answer)
    {
        return waitFor([&]() { return answer->done; }, 180000);
    }

private:
    quint16 m_port;
    QNetworkAccessManager m_network;
};

// Its stderr goes to the test's, so that a failing test shows what the server said.
class ServeProcess
{
public:
    ~ServeProcess()
    {
        m_process.kill();
        m_process.waitForFinished();
    }
    bool start(const QString& dataDir, const QStringList& extra = {})
    {
        m_process.setWorkingDirectory(dataDir);
        m_process.setProcessChannelMode(QProcess::ForwardedErrorChannel);
        m_process.start(DELVIX_HOST_PATH,
                        QStringList{"serve", "--data", dataDir, "--listen", "127.0.0.1:0"} + extra);
        // The banner names the port the system gave it.
        waitFor(
            [&]() {
                m_port = match("http://127\\.0\\.0\\.1:(\\d+)").toUShort();
                return m_port != 0 || m_process.state() == QProcess::NotRunning;
            },
            60000);
        m_http = std::make_unique<ServeConnection>(m_port);
        return m_port != 0;
    }
    quint16 port() const { return m_port; }
    ServeConnection& http() { return *m_http; }
    // SIGTERM: true when it ended by itself with status 0. SIGKILL: true when it died of it.
    bool stop()
    {
        return signal(SIGTERM) && m_process.exitStatus() == QProcess::NormalExit && !m_process.exitCode();
    }
    bool kill() { return signal(SIGKILL) && m_process.exitStatus() == QProcess::CrashExit; }
    // "stopping after N request(s)" once stopped, else -1.
    int requestsServed()
    {
        const QString count = match("stopping after (\\d+) request");
        return count.isEmpty() ? -1 : count.toInt();
    }
    // A field of /proc/PID/status in kB ("VmRSS", "VmHWM"); 0 when unreadable.
    qint64 memoryKb(const char* field) const
    {
        QFile file(QStringLiteral("/proc/%1/status").arg(m_process.processId()));
        const QRegularExpression line(QStringLiteral("^%1:\\s+(\\d+) kB").arg(field),
                                      QRegularExpression::MultilineOption);
        return file.open(QIODevice::ReadOnly) ? line.match(file.readAll()).captured(1).toLongLong() : 0;
    }

private:
    bool signal(int number)
    {
        ::kill(pid_t(m_process.processId()), number);
        return m_process.waitForFinished(scaledMs(60000));
    }
    QString match(const char* pattern)
    {
        m_output += m_process.readAllStandardOutput();
        return QRegularExpression(pattern).match(QString::fromUtf8(m_output)).captured(1);
    }
    QProcess m_process;
    QByteArray m_output;
    quint16 m_port = 0;
    std::unique_ptr<ServeConnection> m_http;
};

// Threads running body(index), with event loops for their connections; joined when this goes.
struct ClientThreads
{
    ClientThreads(int count, const std::function<void(int)>& body)
    {
        for (int i = 0; i < count; ++i) {
            threads.emplace_back(QThread::create(body, i))->start();
        }
    }
    ~ClientThreads()
    {
        for (auto& thread : threads) {
            thread->wait();
        }
    }
    std::vector<std::unique_ptr<QThread>> threads;
};

// One case item as a client sends it and as the vault keeps it.
struct CaseEntry
{
    int caseId = 0;
    QString caseName, nodeId, locId;
    qint64 start = 0, end = 0;
    int type = 0;
    bool needBookmark = false;

    QJsonObject itemJson() const
    {
        return {{"nodeID", nodeId},
                {"locID", locId},
                {"startTimestamp", double(start)},
                {"endTimestamp", double(end)},
                {"caseItemType", type},
                {"needBookmark", needBookmark}};
    }
    // Same item; case id and name compared only when both have one.
    bool sameItem(const CaseEntry& o) const
    {
        return (!caseId || !o.caseId || caseId == o.caseId) &&
               (caseName.isEmpty() || o.caseName.isEmpty() || caseName == o.caseName) &&
               std::tie(nodeId, locId, start, end, type, needBookmark) ==
                   std::tie(o.nodeId, o.locId, o.start, o.end, o.type, o.needBookmark);
    }
};

// The items of a vault file with their cases by start time (unique in these tests), after an
// integrity check; opened read-write, so that a crash's unfinished work is rolled back first.
inline bool readVault(const QString& file, QHash<qint64, CaseEntry>* items, QString* error)
{
    {
        QSqlDatabase database = QSqlDatabase::addDatabase("QSQLITE", "vault-" + file);
        database.setDatabaseName(file);
        QSqlQuery query(database);
        // Never made by opening: a missing vault is a fault.
        if (!QFile::exists(file) || !database.open() || !query.exec("PRAGMA integrity_check") ||
            !query.next() || query.value(0).toString() != "ok" ||
            !query.exec(
                "SELECT CaseItem.caseId, \"Case\".name, nodeId, locationId, startTime, endTime, itemType, "
                "needBookmark FROM CaseItem JOIN \"Case\" ON \"Case\".id = CaseItem.caseId")) {
            *error = "unreadable: " + database.lastError().text() + query.lastError().text() +
                     query.value(0).toString();
        }
        while (error->isEmpty() && query.next()) {
            items->insert(query.value(4).toLongLong(),
                          {query.value(0).toInt(), query.value(1).toString(), query.value(2).toString(),
                           query.value(3).toString(), query.value(4).toLongLong(),
                           query.value(5).toLongLong(), query.value(6).toInt(), query.value(7).toBool()});
        }
    }
    QSqlDatabase::removeDatabase("vault-" + file);
    return error->isEmpty();
}
