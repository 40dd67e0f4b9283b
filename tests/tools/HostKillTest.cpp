// `delvix-host serve` killed while clients write cases: several clients add cases and items at
// once through the HTTP API, the host gets SIGKILL in the middle, and then the vault file must hold
// every case and item a client was told was stored, as the client sent it. A host started again on
// the same data folder serves case commands over that vault.

#include <QCoreApplication>
#include <QDir>
#include <QElapsedTimer>
#include <QEventLoop>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QNetworkAccessManager>
#include <QNetworkReply>
#include <QProcess>
#include <QRegularExpression>
#include <QSqlDatabase>
#include <QSqlError>
#include <QSqlQuery>
#include <QTemporaryDir>
#include <QTimer>
#include <cstdio>
#include <functional>
#include <gtest/gtest.h>
#include <signal.h>

namespace {

constexpr int kClients = 6;
// Kill once this many writes were acknowledged: enough in flight on every client by then.
constexpr int kAcknowledgedBeforeKill = 150;

struct Item
{
    int caseId = 0;
    QString caseName;
    QString nodeId;
    QString locId;
    qint64 start = 0;
    qint64 end = 0;
    int type = 0;
    bool needBookmark = false;
};

struct Answer
{
    bool done = false;
    QList<QJsonObject> lines;
    QString error;
};

// The final reply's code and payload, when the answer carried one.
bool finalLine(const Answer& answer, QJsonObject* line)
{
    for (const QJsonObject& candidate : answer.lines) {
        if (candidate.value(QStringLiteral("final")).toBool()) {
            *line = candidate;
            return true;
        }
    }
    return false;
}

class Host
{
public:
    bool start(const QString& dataDir, QString* log)
    {
        m_process.setProgram(QStringLiteral(DELVIX_HOST_PATH));
        m_process.setWorkingDirectory(dataDir);
        m_process.setArguments({QStringLiteral("serve"), QStringLiteral("--data"), dataDir,
                                QStringLiteral("--listen"), QStringLiteral("127.0.0.1:0")});
        m_process.start();
        if (!m_process.waitForStarted()) {
            return false;
        }
        QElapsedTimer timer;
        timer.start();
        QByteArray out;
        const QRegularExpression banner(QStringLiteral("http://127\\.0\\.0\\.1:(\\d+)"));
        while (m_port == 0 && timer.elapsed() < 60000 && m_process.state() == QProcess::Running) {
            m_process.waitForReadyRead(100);
            out += m_process.readAllStandardOutput();
            m_port = banner.match(QString::fromUtf8(out)).captured(1).toUShort();
        }
        *log = QString::fromUtf8(out + m_process.readAllStandardError());
        return m_port != 0;
    }

    ~Host()
    {
        if (m_process.state() != QProcess::NotRunning) {
            m_process.kill();
            m_process.waitForFinished();
        }
    }

    quint16 port() const { return m_port; }
    QProcess& process() { return m_process; }

private:
    QProcess m_process;
    quint16 m_port = 0;
};

std::shared_ptr<Answer> post(QNetworkAccessManager& network, quint16 port, const QString& command,
                             const QString& client, const QJsonValue& params)
{
    QNetworkRequest request(QUrl(QStringLiteral("http://127.0.0.1:%1/request").arg(port)));
    request.setHeader(QNetworkRequest::ContentTypeHeader, QStringLiteral("application/json"));
    request.setTransferTimeout(120000);
    const QJsonObject envelope{{QStringLiteral("command"), command},
                               {QStringLiteral("client"), client},
                               {QStringLiteral("params"), params},
                               {QStringLiteral("wait"), 60.0}};
    auto answer = std::make_shared<Answer>();
    QNetworkReply* reply = network.post(request, QJsonDocument(envelope).toJson(QJsonDocument::Compact));
    // Lines are taken as they come: after the kill the reply ends in an error, but what arrived
    // before it is what the client was told.
    auto take = [answer, reply]() {
        while (reply->canReadLine()) {
            const QByteArray line = reply->readLine().trimmed();
            if (!line.isEmpty()) {
                answer->lines << QJsonDocument::fromJson(line).object();
            }
        }
    };
    QObject::connect(reply, &QNetworkReply::readyRead, reply, take);
    QObject::connect(reply, &QNetworkReply::finished, reply, [answer, reply, take]() {
        take();
        const QByteArray rest = reply->readAll().trimmed();
        if (!rest.isEmpty()) {
            answer->lines << QJsonDocument::fromJson(rest).object();
        }
        if (reply->error() != QNetworkReply::NoError) {
            answer->error = reply->errorString();
        }
        answer->done = true;
        reply->deleteLater();
    });
    return answer;
}

std::shared_ptr<Answer> postAndWait(QNetworkAccessManager& network, quint16 port, const QString& command,
                                    const QJsonValue& params)
{
    const auto answer = post(network, port, command, QStringLiteral("after-restart"), params);
    QEventLoop loop;
    QTimer tick;
    QObject::connect(&tick, &QTimer::timeout, &loop, [&]() {
        if (answer->done) {
            loop.quit();
        }
    });
    tick.start(5);
    loop.exec();
    return answer;
}

QJsonObject itemJson(const Item& item)
{
    return {{QStringLiteral("nodeID"), item.nodeId},
            {QStringLiteral("locID"), item.locId},
            {QStringLiteral("startTimestamp"), double(item.start)},
            {QStringLiteral("endTimestamp"), double(item.end)},
            {QStringLiteral("caseItemType"), item.type},
            {QStringLiteral("needBookmark"), item.needBookmark}};
}

// One client: one request at a time, a new case or an item for one of its acknowledged cases.
class Writer
{
public:
    Writer(int index, QNetworkAccessManager* network, quint16 port, const bool* stopped,
           QList<Item>* acknowledged, int* cutShort, std::function<void()> onAnswer)
        : m_index(index)
        , m_network(network)
        , m_port(port)
        , m_stopped(stopped)
        , m_acknowledged(acknowledged)
        , m_cutShort(cutShort)
        , m_onAnswer(std::move(onAnswer))
    {}

    bool idle() const { return !m_busy; }

    void next()
    {
        if (*m_stopped) {
            return;
        }
        QList<Item> items{newItem()};
        QString command;
        QJsonObject params;
        if (m_cases.isEmpty() || m_sequence % 4 == 0) {
            command = QStringLiteral("addCaseWithItem");
            items[0].caseName = QStringLiteral("killed host %1 case %2").arg(m_index).arg(m_sequence);
            params = {{QStringLiteral("caseName"), items[0].caseName},
                      {QStringLiteral("reporter"), QStringLiteral("writer %1").arg(m_index)},
                      {QStringLiteral("caseItem"), itemJson(items[0])}};
        } else if (m_sequence % 4 == 1) {
            // A case made with two recordings at once.
            command = QStringLiteral("addCaseWithRecordings");
            items << newItem();
            QJsonArray list;
            for (Item& item : items) {
                item.caseName = QStringLiteral("killed host %1 recordings %2").arg(m_index).arg(m_sequence);
                item.type = 1;
                list.append(itemJson(item));
            }
            params = {{QStringLiteral("caseName"), items[0].caseName},
                      {QStringLiteral("reporter"), QStringLiteral("writer %1").arg(m_index)},
                      {QStringLiteral("caseItem"), list}};
        } else {
            command = QStringLiteral("addCaseItem");
            const Item& owner = m_cases.at(m_sequence % int(m_cases.size()));
            items[0].caseId = owner.caseId;
            items[0].caseName = owner.caseName;
            params = itemJson(items[0]);
            params.insert(QStringLiteral("caseId"), owner.caseId);
        }
        m_busy = true;
        const std::shared_ptr<Answer> answer =
            post(*m_network, m_port, command, QStringLiteral("writer-%1").arg(m_index), params);
        QTimer* poll = new QTimer;
        QObject::connect(poll, &QTimer::timeout, poll, [this, answer, items, command, poll]() mutable {
            if (!answer->done) {
                return;
            }
            poll->stop();
            poll->deleteLater();
            QJsonObject line;
            if (!finalLine(*answer, &line)) {
                ++*m_cutShort;
            } else if (line.value(QStringLiteral("code")).toString() == QLatin1String("0")) {
                if (command != QLatin1String("addCaseItem")) {
                    const int caseId = line.value(QStringLiteral("payload"))
                                           .toObject()
                                           .value(QStringLiteral("caseId"))
                                           .toInt();
                    for (Item& item : items) {
                        item.caseId = caseId;
                    }
                    m_cases << items[0];
                }
                *m_acknowledged << items;
            }
            m_busy = false;
            m_onAnswer();
            next();
        });
        poll->start(2);
    }

private:
    Item newItem()
    {
        Item item;
        item.nodeId = QStringLiteral("Cam%1").arg(m_index % 5 + 1);
        item.locId = QStringLiteral("Loc%1").arg(m_index % 5 + 1);
        item.start = 1704067200000LL + qint64(m_index) * 1000000000LL + qint64(++m_sequence) * 1000;
        item.end = item.start + 30000 + m_sequence;
        item.type = m_sequence % 2;
        item.needBookmark = m_sequence % 5 == 0;
        return item;
    }

    const int m_index;
    QNetworkAccessManager* m_network;
    const quint16 m_port;
    const bool* m_stopped;
    QList<Item>* m_acknowledged;
    int* m_cutShort;
    std::function<void()> m_onAnswer;
    QList<Item> m_cases;
    int m_sequence = 0;
    bool m_busy = false;
};

QString findInVault(const QString& file, const QList<Item>& acknowledged, int* cases, int* items)
{
    const QString connection = QStringLiteral("killed-host-vault");
    QString problems;
    {
        QSqlDatabase database = QSqlDatabase::addDatabase(QStringLiteral("QSQLITE"), connection);
        // Read-write: the first opener after a crash rolls back a transaction left unfinished.
        database.setDatabaseName(file);
        if (!database.open()) {
            problems = database.lastError().text();
        } else {
            QSqlQuery check(database);
            if (!check.exec(QStringLiteral("PRAGMA integrity_check")) || !check.next() ||
                check.value(0).toString() != QLatin1String("ok")) {
                problems += QStringLiteral("integrity check: %1\n").arg(check.value(0).toString());
            }
            QSqlQuery count(database);
            if (count.exec(QStringLiteral(
                    "SELECT (SELECT COUNT(*) FROM \"Case\"), (SELECT COUNT(*) FROM CaseItem)")) &&
                count.next()) {
                *cases = count.value(0).toInt();
                *items = count.value(1).toInt();
            }
            for (const Item& item : acknowledged) {
                QSqlQuery query(database);
                query.prepare(QStringLiteral(
                    "SELECT CaseItem.caseId, \"Case\".name, nodeId, locationId, endTime, itemType, "
                    "needBookmark "
                    "FROM CaseItem JOIN \"Case\" ON \"Case\".id = CaseItem.caseId WHERE startTime = ?"));
                query.addBindValue(item.start);
                if (!query.exec() || !query.next()) {
                    problems += QStringLiteral("case %1 \"%2\": the item starting %3 is missing\n")
                                    .arg(item.caseId)
                                    .arg(item.caseName)
                                    .arg(item.start);
                    continue;
                }
                if (query.value(0).toInt() != item.caseId || query.value(1).toString() != item.caseName ||
                    query.value(2).toString() != item.nodeId || query.value(3).toString() != item.locId ||
                    query.value(4).toLongLong() != item.end || query.value(5).toInt() != item.type ||
                    query.value(6).toBool() != item.needBookmark) {
                    problems +=
                        QStringLiteral("case %1 \"%2\": the item starting %3 differs (case %4 \"%5\")\n")
                            .arg(item.caseId)
                            .arg(item.caseName)
                            .arg(item.start)
                            .arg(query.value(0).toInt())
                            .arg(query.value(1).toString());
                }
            }
            database.close();
        }
    }
    QSqlDatabase::removeDatabase(connection);
    return problems;
}

// Clients write until kAcknowledgedBeforeKill writes were acknowledged, then the host is killed.
// Fills the acknowledged writes and how many were cut short (sent but never answered).
void runUntilKilled(const QString& dataPath, QList<Item>* acknowledgedOut, int* cutShortOut)
{
    QList<Item>& acknowledged = *acknowledgedOut;
    int& cutShort = *cutShortOut;
    {
        Host host;
        QString log;
        ASSERT_TRUE(host.start(dataPath, &log)) << qPrintable(log);
        QNetworkAccessManager network;
        bool stopped = false;
        std::vector<std::unique_ptr<Writer>> writers;
        auto onAnswer = [&]() {
            if (!stopped && acknowledged.size() >= kAcknowledgedBeforeKill) {
                // In the middle of the writes: every client has one in flight now.
                stopped = true;
                ::kill(pid_t(host.process().processId()), SIGKILL);
            }
        };
        for (int i = 0; i < kClients; ++i) {
            writers.push_back(std::make_unique<Writer>(i, &network, host.port(), &stopped, &acknowledged,
                                                       &cutShort, onAnswer));
            writers.back()->next();
        }
        QEventLoop loop;
        QTimer tick;
        QElapsedTimer timer;
        timer.start();
        QObject::connect(&tick, &QTimer::timeout, &loop, [&]() {
            const bool allIdle =
                std::all_of(writers.cbegin(), writers.cend(), [](const auto& w) { return w->idle(); });
            if ((stopped && allIdle) || timer.elapsed() > 120000) {
                loop.quit();
            }
        });
        tick.start(10);
        loop.exec();
        ASSERT_TRUE(stopped) << "only " << acknowledged.size() << " writes acknowledged in two minutes";
        ASSERT_TRUE(host.process().state() == QProcess::NotRunning || host.process().waitForFinished(20000));
        EXPECT_EQ(host.process().exitStatus(), QProcess::CrashExit);
    }
}

} // namespace

TEST(HostKill, AcknowledgedCaseWritesSurviveSigkillAndTheHostServesThemAgain)
{
    // A kill that falls between writes (every reply already sent) proves less: such a run is
    // repeated on a fresh folder, up to three times in all.
    std::unique_ptr<QTemporaryDir> folder;
    QList<Item> acknowledged;
    int cutShort = 0;
    for (int attempt = 0; attempt < 3 && cutShort == 0; ++attempt) {
        folder = std::make_unique<QTemporaryDir>();
        ASSERT_TRUE(folder->isValid());
        acknowledged.clear();
        runUntilKilled(folder->path(), &acknowledged, &cutShort);
        if (HasFatalFailure()) {
            return;
        }
    }
    const QTemporaryDir& data = *folder;
    ASSERT_GE(acknowledged.size(), kAcknowledgedBeforeKill);
#ifndef DELVIX_TEST_TIME_SCALE
    EXPECT_GE(cutShort, 1) << "the kill came between writes, not in the middle of one";
#else
    // An instrumented test process reads the replies so late that the host has often answered every
    // write by then, three times running; what was acknowledged is checked all the same.
#endif

    const QString vault = QDir(data.path()).filePath(QStringLiteral("database/PluginDelvix/CaseVault.db"));
    int casesInVault = 0;
    int itemsInVault = 0;
    const QString problems = findInVault(vault, acknowledged, &casesInVault, &itemsInVault);
    EXPECT_TRUE(problems.isEmpty()) << qPrintable(problems);
    EXPECT_GE(itemsInVault, int(acknowledged.size()));
    std::printf("acknowledged %d, cut short by the kill %d, in the vault %d case(s) and %d item(s)\n",
                int(acknowledged.size()), cutShort, casesInVault, itemsInVault);

    // The same data folder again: the vault is served, and takes new cases.
    Host again;
    QString log;
    ASSERT_TRUE(again.start(data.path(), &log)) << qPrintable(log);
    QNetworkAccessManager network;
    auto answer = postAndWait(network, again.port(), QStringLiteral("getCaseList"), QJsonObject());
    QJsonObject line;
    ASSERT_TRUE(finalLine(*answer, &line)) << qPrintable(answer->error);
    EXPECT_EQ(line.value(QStringLiteral("code")).toString(), QStringLiteral("0"));
    QSet<int> listed;
    for (const QJsonValue& summary : line.value(QStringLiteral("payload")).toArray()) {
        listed.insert(summary.toObject().value(QStringLiteral("caseId")).toInt());
    }
    EXPECT_EQ(listed.size(), casesInVault);
    QMap<int, int> itemsOfCase;
    for (const Item& item : acknowledged) {
        EXPECT_TRUE(listed.contains(item.caseId)) << "case " << item.caseId;
        ++itemsOfCase[item.caseId];
    }
    // A case with the most acknowledged items reads them all back through the plug-in.
    const auto busiest = std::max_element(itemsOfCase.cbegin(), itemsOfCase.cend());
    answer = postAndWait(network, again.port(), QStringLiteral("retrieveCaseItemModel"), busiest.key());
    ASSERT_TRUE(finalLine(*answer, &line)) << qPrintable(answer->error);
    EXPECT_EQ(line.value(QStringLiteral("code")).toString(), QStringLiteral("0"));
    EXPECT_GE(line.value(QStringLiteral("payload"))
                  .toObject()
                  .value(QStringLiteral("caseItemList"))
                  .toArray()
                  .size(),
              busiest.value());

    Item fresh;
    fresh.nodeId = QStringLiteral("Cam1");
    fresh.locId = QStringLiteral("Loc1");
    fresh.start = 1704067200000LL - 5000;
    fresh.end = fresh.start + 1000;
    answer = postAndWait(network, again.port(), QStringLiteral("addCaseWithItem"),
                         QJsonObject{{QStringLiteral("caseName"), QStringLiteral("after the kill")},
                                     {QStringLiteral("caseItem"), itemJson(fresh)}});
    ASSERT_TRUE(finalLine(*answer, &line)) << qPrintable(answer->error);
    EXPECT_EQ(line.value(QStringLiteral("code")).toString(), QStringLiteral("0"));
    EXPECT_EQ(line.value(QStringLiteral("payload")).toObject().value(QStringLiteral("caseName")).toString(),
              QStringLiteral("after the kill"));

    ::kill(pid_t(again.process().processId()), SIGTERM);
    ASSERT_TRUE(again.process().waitForFinished(30000));
    EXPECT_EQ(again.process().exitStatus(), QProcess::NormalExit);
    EXPECT_EQ(again.process().exitCode(), 0);
}
