#include "ServeClient.h"

#include "TestWait.h"

#include <QFile>
#include <QJsonDocument>
#include <QRegularExpression>
#include <QSqlDatabase>
#include <QSqlError>
#include <QSqlQuery>
#include <algorithm>
#include <signal.h>

int ServeAnswer::finalCount() const
{
    return int(std::count_if(lines.cbegin(), lines.cend(), [](auto& l) { return l["final"].toBool(); }));
}

ServeAnswerPtr ServeConnection::post(const QString& path, const QByteArray& body)
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

ServeAnswerPtr ServeConnection::request(const QString& command, const QJsonValue& params,
                                        const QString& client, double wait)
{
    const QJsonObject envelope{{"command", command}, {"client", client}, {"params", params}, {"wait", wait}};
    return post("/request", QJsonDocument(envelope).toJson(QJsonDocument::Compact));
}

ServeAnswer ServeConnection::call(const QString& command, const QJsonValue& params, const QString& client,
                                  double wait)
{
    const ServeAnswerPtr answer = request(command, params, client, wait);
    ServeConnection::wait(answer);
    return *answer;
}

bool ServeConnection::wait(const ServeAnswerPtr& answer)
{
    // The transfer timeout ends every answer; this limit only guards against a stuck loop.
    return waitFor([&]() { return answer->done; }, 180000);
}

ServeProcess::~ServeProcess()
{
    m_process.kill();
    m_process.waitForFinished();
}

bool ServeProcess::start(const QString& dataDir, const QStringList& extra)
{
    m_process.setWorkingDirectory(dataDir);
    m_process.setProcessChannelMode(QProcess::ForwardedErrorChannel);
    m_process.start(DELVIX_HOST_PATH,
                    QStringList{"serve", "--data", dataDir, "--listen", "127.0.0.1:0"} + extra);
    // The banner names the port the system gave it.
    const QRegularExpression banner("http://127\\.0\\.0\\.1:(\\d+)");
    waitFor(
        [&]() {
            m_output += m_process.readAllStandardOutput();
            m_port = banner.match(QString::fromUtf8(m_output)).captured(1).toUShort();
            return m_port != 0 || m_process.state() == QProcess::NotRunning;
        },
        60000);
    m_http = std::make_unique<ServeConnection>(m_port);
    return m_port != 0;
}

bool ServeProcess::signal(int number)
{
    ::kill(pid_t(m_process.processId()), number);
    return m_process.waitForFinished(scaledMs(60000));
}

int ServeProcess::requestsServed()
{
    m_output += m_process.readAllStandardOutput();
    const auto match = QRegularExpression("stopping after (\\d+) request").match(QString::fromUtf8(m_output));
    return match.hasMatch() ? match.captured(1).toInt() : -1;
}

qint64 ServeProcess::memoryKb(const char* field) const
{
    QFile file(QStringLiteral("/proc/%1/status").arg(m_process.processId()));
    const QRegularExpression line(QStringLiteral("^%1:\\s+(\\d+) kB").arg(field),
                                  QRegularExpression::MultilineOption);
    return file.open(QIODevice::ReadOnly) ? line.match(file.readAll()).captured(1).toLongLong() : 0;
}

ClientThreads::ClientThreads(int count, const std::function<void(int)>& body)
{
    for (int i = 0; i < count; ++i) {
        threads.emplace_back(body, i);
    }
}

ClientThreads::~ClientThreads()
{
    for (std::thread& thread : threads) {
        thread.join();
    }
}

QJsonObject CaseEntry::itemJson() const
{
    return {{"nodeID", nodeId},
            {"locID", locId},
            {"startTimestamp", double(start)},
            {"endTimestamp", double(end)},
            {"caseItemType", type},
            {"needBookmark", needBookmark}};
}

bool CaseEntry::sameItem(const CaseEntry& o) const
{
    return (!caseId || !o.caseId || caseId == o.caseId) &&
           (caseName.isEmpty() || o.caseName.isEmpty() || caseName == o.caseName) &&
           std::tie(nodeId, locId, start, end, type, needBookmark) ==
               std::tie(o.nodeId, o.locId, o.start, o.end, o.type, o.needBookmark);
}

bool readVault(const QString& file, QHash<qint64, CaseEntry>* items, QString* error)
{
    const QString connection = "vault-" + file;
    {
        QSqlDatabase database = QSqlDatabase::addDatabase("QSQLITE", connection);
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
            items = nullptr;
        }
        while (items && query.next()) {
            items->insert(query.value(4).toLongLong(),
                          {query.value(0).toInt(), query.value(1).toString(), query.value(2).toString(),
                           query.value(3).toString(), query.value(4).toLongLong(),
                           query.value(5).toLongLong(), query.value(6).toInt(), query.value(7).toBool()});
        }
    }
    QSqlDatabase::removeDatabase(connection);
    return error->isEmpty();
}
