#include "ServeClient.h"

#include "TestWait.h"

#include <QDir>
#include <QFile>
#include <QJsonDocument>
#include <QNetworkReply>
#include <QRegularExpression>
#include <QSqlDatabase>
#include <QSqlError>
#include <QSqlQuery>
#include <algorithm>
#include <signal.h>

int ServeAnswer::finalCount() const
{
    return int(std::count_if(lines.cbegin(), lines.cend(),
                             [](const QJsonObject& l) { return l.value("final").toBool(); }));
}

ServeAnswerPtr ServeConnection::post(const QString& path, const QByteArray& body)
{
    QNetworkRequest request(QUrl(QStringLiteral("http://127.0.0.1:%1%2").arg(m_port).arg(path)));
    request.setHeader(QNetworkRequest::ContentTypeHeader, "application/json");
    // Generous: an answer still open after this is a lost reply, not a slow one.
    request.setTransferTimeout(scaledMs(120000));
    auto answer = std::make_shared<ServeAnswer>();
    QNetworkReply* reply = m_network.post(request, body);
    // Lines are taken as they come: when the server dies, what arrived before is what the client
    // was told.
    auto take = [answer, reply](bool all) {
        while (reply->canReadLine() || (all && reply->bytesAvailable() > 0)) {
            const QByteArray line = reply->readLine().trimmed();
            if (!line.isEmpty()) {
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
    ServeConnection::wait({answer});
    return *answer;
}

bool ServeConnection::wait(const QList<ServeAnswerPtr>& answers)
{
    // The transfer timeout ends every answer; this limit only guards against a stuck loop.
    return waitFor(
        [&]() { return std::all_of(answers.cbegin(), answers.cend(), [](auto& a) { return a->done; }); },
        180000);
}

ServeProcess::~ServeProcess()
{
    if (m_process.state() != QProcess::NotRunning) {
        m_process.kill();
        m_process.waitForFinished();
    }
}

bool ServeProcess::start(const QString& dataDir, const QStringList& extra)
{
    m_process.setWorkingDirectory(dataDir);
    m_process.setProcessChannelMode(QProcess::ForwardedErrorChannel);
    m_process.start(QStringLiteral(DELVIX_HOST_PATH),
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

bool ServeProcess::stop()
{
    ::kill(pid_t(m_process.processId()), SIGTERM);
    return m_process.waitForFinished(scaledMs(60000)) && m_process.exitStatus() == QProcess::NormalExit &&
           m_process.exitCode() == 0;
}

bool ServeProcess::kill()
{
    ::kill(pid_t(m_process.processId()), SIGKILL);
    return m_process.waitForFinished(scaledMs(20000)) && m_process.exitStatus() == QProcess::CrashExit;
}

int ServeProcess::requestsServed()
{
    m_output += m_process.readAllStandardOutput();
    const QRegularExpressionMatch match =
        QRegularExpression("stopping after (\\d+) request").match(QString::fromUtf8(m_output));
    return match.hasMatch() ? match.captured(1).toInt() : -1;
}

qint64 ServeProcess::memoryKb(const char* field) const
{
    QFile file(QStringLiteral("/proc/%1/status").arg(m_process.processId()));
    if (!file.open(QIODevice::ReadOnly)) {
        return 0;
    }
    const QRegularExpression line(QStringLiteral("^%1:\\s+(\\d+) kB").arg(QLatin1String(field)),
                                  QRegularExpression::MultilineOption);
    return line.match(QString::fromLatin1(file.readAll())).captured(1).toLongLong();
}

ClientThreads::ClientThreads(int count, const std::function<void(int)>& body)
{
    for (int i = 0; i < count; ++i) {
        m_threads.emplace_back(QThread::create(body, i));
        m_threads.back()->start();
    }
}

ClientThreads::~ClientThreads()
{
    for (const auto& thread : m_threads) {
        thread->wait();
    }
}

bool ClientThreads::join(int limitMs)
{
    return waitFor(
        [this]() {
            return std::all_of(m_threads.cbegin(), m_threads.cend(), [](auto& t) { return t->isFinished(); });
        },
        limitMs);
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

bool CaseEntry::sameItem(const CaseEntry& other) const
{
    return (caseId == 0 || other.caseId == 0 || caseId == other.caseId) &&
           (caseName.isEmpty() || other.caseName.isEmpty() || caseName == other.caseName) &&
           nodeId == other.nodeId && locId == other.locId && start == other.start && end == other.end &&
           type == other.type && needBookmark == other.needBookmark;
}

bool readVault(const QString& file, QHash<qint64, CaseEntry>* items, QString* error)
{
    const QString connection = QStringLiteral("vault-") + file;
    bool ok = false;
    {
        QSqlDatabase database = QSqlDatabase::addDatabase("QSQLITE", connection);
        database.setDatabaseName(file);
        // Never made by opening: a missing vault is a fault.
        const bool open = QFile::exists(file) && database.open();
        QSqlQuery query(database);
        if (!open) {
            *error = QStringLiteral("cannot open: ") + database.lastError().text();
        } else if (!query.exec("PRAGMA integrity_check") || !query.next() ||
                   query.value(0).toString() != QLatin1String("ok")) {
            *error = QStringLiteral("integrity check: ") + query.value(0).toString();
        } else if (!query.exec(QStringLiteral(
                       "SELECT CaseItem.caseId, \"Case\".name, nodeId, locationId, startTime, endTime, "
                       "itemType, needBookmark FROM CaseItem JOIN \"Case\" ON \"Case\".id = "
                       "CaseItem.caseId"))) {
            *error = query.lastError().text();
        } else {
            ok = true;
            while (query.next()) {
                items->insert(query.value(4).toLongLong(),
                              CaseEntry{query.value(0).toInt(), query.value(1).toString(),
                                        query.value(2).toString(), query.value(3).toString(),
                                        query.value(4).toLongLong(), query.value(5).toLongLong(),
                                        query.value(6).toInt(), query.value(7).toBool()});
            }
        }
    }
    QSqlDatabase::removeDatabase(connection);
    return ok;
}
