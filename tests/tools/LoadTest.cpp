// The whole system under load, as a person runs it: `delvix-host serve` on a seeded store, many
// clients at once through the HTTP API (searches, some stopped by their client, re-identifications
// and case commands), the synchroniser pulling from the site's cameras, and the database path
// moved once in the middle. Afterwards every request must have ended with its final reply, every
// case and item a client was told was stored must be in a vault with what the client sent, no
// client may have seen another's hits, and the memory of the server must not keep growing.
//
// Sizes come from the environment, with defaults small enough for CI on two cores:
//   DELVIX_LOAD_CLIENTS (8)  DELVIX_LOAD_SECONDS (20)  DELVIX_LOAD_OBJECTS (10000)
//   DELVIX_LOAD_CAMERAS (0: the built-in site; N: a generated site of N cameras at Loc1..LocN)
// Every client starts with one request of each kind, so that even a short run has all kinds in
// flight together: the sanitizer runs count on that.
// scripts/load-test.sh runs the large variant and shows the report this test prints.

#include <QCoreApplication>
#include <QDateTime>
#include <QDir>
#include <QElapsedTimer>
#include <QEventLoop>
#include <QFile>
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
#include <QThread>
#include <QTimer>
#include <algorithm>
#include <atomic>
#include <cstdio>
#include <gtest/gtest.h>
#include <memory>
#include <random>
#include <signal.h>

// Sanitizer builds keep shadow memory and freed blocks in quarantine: their resident size says
// nothing about our own growth, so there it is reported only.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define DELVIX_LOAD_INSTRUMENTED 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define DELVIX_LOAD_INSTRUMENTED 1
#endif
#endif

#ifndef DELVIX_TEST_TIME_SCALE
#define DELVIX_TEST_TIME_SCALE 1
#endif

namespace {

// Instrumented builds do the same work several times slower; the build says how much.
constexpr int kTimeScale = DELVIX_TEST_TIME_SCALE;
// The kinds of request a client sends, in the order of its first round.
constexpr int kRequestKinds = 6;

// The seeder spreads each location's objects over four hours from this time.
constexpr qint64 kSeedStartMs = 1704067200000LL;
constexpr qint64 kSeedSpanMs = 4 * 3600 * 1000LL;
// Generous: a request still open after this is a lost reply, not a slow one.
constexpr int kRequestTimeoutMs = 120000 * kTimeScale;
// How long the API waits for a first reply before it ends an answer as one of a command that
// sends none. Searches run one at a time, so under load a search may wait its turn for many
// seconds: the API's default of 2 s would end its answer empty and drop its hits.
constexpr double kFirstReplyWaitSeconds = 90.0 * kTimeScale;

int envInt(const char* name, int fallback)
{
    bool ok = false;
    const int value = qEnvironmentVariable(name).toInt(&ok);
    return ok && value > 0 ? value : fallback;
}

QString locationOf(int client)
{
    return QStringLiteral("Loc%1").arg(client + 1);
}

// "VmHWM" or "VmRSS" of a process, in kB (0 when unreadable).
qint64 procStatusKb(qint64 pid, const char* field)
{
    QFile file(QStringLiteral("/proc/%1/status").arg(pid));
    if (!file.open(QIODevice::ReadOnly)) {
        return 0;
    }
    const QRegularExpression line(QStringLiteral("^%1:\\s+(\\d+) kB").arg(QLatin1String(field)),
                                  QRegularExpression::MultilineOption);
    return line.match(QString::fromLatin1(file.readAll())).captured(1).toLongLong();
}

// Which vault an acknowledged write must be in: the first path's, the second's, or (when the
// request overlapped the change) either.
enum Vault
{
    OldVault = 0,
    NewVault = 1,
    EitherVault = -1
};

struct StoredItem
{
    int caseId = 0;
    QString caseName;
    QString nodeId;
    QString locId;
    qint64 start = 0;
    qint64 end = 0;
    int type = 0;
    bool needBookmark = false;
    int vault = EitherVault;
};

// A search to run again alone after the load, to compare its number of hits.
struct Replay
{
    QString command;
    QJsonObject params;
    qsizetype hits = 0;
    bool stopped = false;
};

struct ClientStats
{
    int sent = 0;
    int finals = 0;     // requests that ended with their final reply
    int silentEnds = 0; // stop commands (no reply) whose answer ended
    int searches = 0;
    int stoppedSearches = 0;
    int reIdSearches = 0;
    int caseCommands = 0;
    int hits = 0;
    QMap<QString, int> failureCodes; // "command code" -> count, for the report
    QStringList faults;              // lost replies, foreign hits, refused case writes
    QList<StoredItem> cases;         // acknowledged cases, with the item they were made with
    QList<StoredItem> items;         // acknowledged items added to existing cases
    QList<Replay> replays;
};

struct Answer
{
    bool done = false;
    int status = 0;
    QString error;
    QList<QJsonObject> lines;
};

// One POST /request, answered asynchronously on the calling thread's event loop.
std::shared_ptr<Answer> post(QNetworkAccessManager& network, quint16 port, const QJsonObject& envelope)
{
    QNetworkRequest request(QUrl(QStringLiteral("http://127.0.0.1:%1/request").arg(port)));
    request.setHeader(QNetworkRequest::ContentTypeHeader, QStringLiteral("application/json"));
    request.setTransferTimeout(kRequestTimeoutMs);
    auto answer = std::make_shared<Answer>();
    QNetworkReply* reply = network.post(request, QJsonDocument(envelope).toJson(QJsonDocument::Compact));
    QObject::connect(reply, &QNetworkReply::finished, reply, [answer, reply]() {
        answer->status = reply->attribute(QNetworkRequest::HttpStatusCodeAttribute).toInt();
        if (reply->error() != QNetworkReply::NoError) {
            answer->error = reply->errorString();
        }
        for (const QByteArray& line : reply->readAll().split('\n')) {
            if (!line.trimmed().isEmpty()) {
                answer->lines << QJsonDocument::fromJson(line).object();
            }
        }
        answer->done = true;
        reply->deleteLater();
    });
    return answer;
}

void waitFor(const QList<std::shared_ptr<Answer>>& answers)
{
    QEventLoop loop;
    QTimer tick;
    QObject::connect(&tick, &QTimer::timeout, &loop, [&]() {
        if (std::all_of(answers.cbegin(), answers.cend(), [](const auto& a) { return a->done; })) {
            loop.quit();
        }
    });
    tick.start(10);
    loop.exec();
}

void sleepOnLoop(int ms)
{
    QEventLoop loop;
    QTimer::singleShot(ms, &loop, &QEventLoop::quit);
    loop.exec();
}

class LoadClient
{
public:
    LoadClient(int index, quint16 port, qint64 deadlineMs, const std::atomic<int>* phase, ClientStats* stats)
        : m_index(index)
        , m_port(port)
        , m_deadlineMs(deadlineMs)
        , m_phase(phase)
        , m_stats(stats)
        , m_name(QStringLiteral("load-client-%1").arg(index))
        , m_stopName(m_name + QStringLiteral("-stops"))
        , m_location(locationOf(index))
        , m_random(std::mt19937::result_type(1000 + index))
    {}

    void run()
    {
        // A first round of every kind, each client starting at another, so that even a short run
        // has all kinds in flight at once; then a random mix.
        for (int i = 0; i < kRequestKinds && QDateTime::currentMSecsSinceEpoch() < m_deadlineMs; ++i) {
            send((m_index + i) % kRequestKinds);
        }
        while (QDateTime::currentMSecsSinceEpoch() < m_deadlineMs) {
            const int pick = pickUpTo(100);
            send(pick < 30 ? 0 : pick < 45 ? 1 : pick < 60 ? 2 : pick < 80 ? 3 : pick < 92 ? 4 : 5);
        }
    }

private:
    void send(int kind)
    {
        switch (kind) {
        case 0:
            search(false);
            break;
        case 1:
            search(true);
            break;
        case 2:
            reIdSearch(pickUpTo(3) == 0);
            break;
        case 3:
            addCaseWithItem();
            break;
        case 4:
            addCaseItem();
            break;
        default:
            readCases();
            break;
        }
    }

    int pickUpTo(int bound) { return std::uniform_int_distribution<int>(0, bound - 1)(m_random); }

    QJsonObject envelope(const QString& command, const QJsonValue& params,
                         double wait = kFirstReplyWaitSeconds, const QString& name = QString()) const
    {
        return {{QStringLiteral("command"), command},
                {QStringLiteral("client"), name.isEmpty() ? m_name : name},
                {QStringLiteral("params"), params},
                {QStringLiteral("wait"), wait}};
    }

    // A request that must end with exactly one final reply, as its last line.
    bool checkFinal(const QString& command, const Answer& answer)
    {
        ++m_stats->sent;
        const bool lastIsFinal =
            !answer.lines.isEmpty() && answer.lines.last().value(QStringLiteral("final")).toBool();
        const auto finals =
            std::count_if(answer.lines.cbegin(), answer.lines.cend(),
                          [](const QJsonObject& l) { return l.value(QStringLiteral("final")).toBool(); });
        if (answer.status != 200 || !answer.error.isEmpty() || !lastIsFinal || finals != 1) {
            m_stats->faults << QStringLiteral("%1 %2: no final reply (HTTP %3, %4, %5 line(s), %6 final)")
                                   .arg(m_name, command)
                                   .arg(answer.status)
                                   .arg(answer.error.isEmpty() ? QStringLiteral("no error") : answer.error)
                                   .arg(answer.lines.size())
                                   .arg(finals);
            return false;
        }
        ++m_stats->finals;
        const QString code = answer.lines.last().value(QStringLiteral("code")).toString();
        if (code != QLatin1String("0")) {
            ++m_stats->failureCodes[command + QLatin1Char(' ') + code];
        }
        return true;
    }

    void checkSilent(const QString& command, const Answer& answer)
    {
        ++m_stats->sent;
        if (answer.status != 200 || !answer.error.isEmpty()) {
            m_stats->faults << QStringLiteral("%1 %2: answer did not end cleanly (HTTP %3, %4)")
                                   .arg(m_name, command)
                                   .arg(answer.status)
                                   .arg(answer.error);
            return;
        }
        ++m_stats->silentEnds;
    }

    // Every hit must be from this client's own location and overlap its own window (the store
    // works in whole seconds).
    void checkHits(const QString& command, const Answer& answer, qint64 startMs, qint64 endMs)
    {
        for (const QJsonObject& line : answer.lines) {
            if (line.value(QStringLiteral("final")).toBool()) {
                continue;
            }
            const QJsonObject hit = line.value(QStringLiteral("payload")).toObject();
            ++m_stats->hits;
            const QString loc = hit.value(QStringLiteral("locID")).toString();
            const qint64 hitStart = qint64(hit.value(QStringLiteral("startTimestamp")).toDouble());
            const qint64 hitEnd =
                qint64(hit.value(QStringLiteral("endTimestamp")).toDouble(double(hitStart)));
            if (loc != m_location || hitStart > endMs + 999 || hitEnd < startMs - 999) {
                m_stats->faults << QStringLiteral("%1 %2: foreign hit at %3 %4..%5 (asked %6 %7..%8)")
                                       .arg(m_name, command, loc)
                                       .arg(hitStart)
                                       .arg(hitEnd)
                                       .arg(m_location)
                                       .arg(startMs)
                                       .arg(endMs);
                continue;
            }
            const QJsonArray feature = hit.value(QStringLiteral("feature")).toArray();
            if (feature.size() == 512) {
                m_feature = feature;
            }
        }
    }

    QJsonObject searchParams(qint64 startMs, qint64 endMs) const
    {
        return {{QStringLiteral("startTimestamp"), double(startMs)},
                {QStringLiteral("endTimestamp"), double(endMs)},
                {QStringLiteral("locIDList"), QJsonArray{m_location}}};
    }

    // A random window inside the seeded span.
    std::pair<qint64, qint64> window(qint64 lengthMs)
    {
        const qint64 start =
            kSeedStartMs + std::uniform_int_distribution<qint64>(0, kSeedSpanMs - lengthMs)(m_random);
        return {start, start + lengthMs};
    }

    void runStoppable(const QString& command, const QString& stopCommand, QJsonObject params, bool stop,
                      qint64 startMs, qint64 endMs)
    {
        QNetworkAccessManager& network = m_network;
        // Searches meant to be stopped go under a second name of this client: a stop answer ends
        // before the plug-in may have handled the stop, and a late stop must not reach the next
        // search, which is compared in full below.
        const QString& name = stop ? m_stopName : m_name;
        const auto answer = post(network, m_port, envelope(command, params, kFirstReplyWaitSeconds, name));
        if (!stop) {
            waitFor({answer});
        } else {
            sleepOnLoop(10 + pickUpTo(150));
            const auto stopped = post(network, m_port, envelope(stopCommand, QJsonObject(), 0.2, name));
            waitFor({answer, stopped});
            checkSilent(stopCommand, *stopped);
        }
        if (!checkFinal(command, *answer)) {
            return;
        }
        checkHits(command, *answer, startMs, endMs);
        // A search that nobody stopped must deliver all its hits, whatever other clients stop
        // meanwhile.
        const Replay replay{command, params, answer->lines.size() - 1, stop};
        if (stop ? m_stoppedReplays < 3 : m_unstoppedReplays < 6) {
            ++(stop ? m_stoppedReplays : m_unstoppedReplays);
            m_stats->replays << replay;
        }
    }

    void search(bool stop)
    {
        stop ? ++m_stats->stoppedSearches : ++m_stats->searches;
        // Stopped searches ask for more, so that the stop usually meets a running search.
        const auto [startMs, endMs] = window(stop ? 3600 * 1000LL : 600 * 1000LL);
        QJsonObject params = searchParams(startMs, endMs);
        if (pickUpTo(2) == 0) {
            params.insert(QStringLiteral("humanInfo"),
                          QStringLiteral("{\"Gender\":%1}").arg(1 + pickUpTo(2)));
        }
        runStoppable(QStringLiteral("startSearch"), QStringLiteral("stopSearch"), params, stop, startMs,
                     endMs);
    }

    void reIdSearch(bool stop)
    {
        if (m_feature.isEmpty()) {
            search(false); // nothing to look for yet
            return;
        }
        ++m_stats->reIdSearches;
        const auto [startMs, endMs] = window(3600 * 1000LL);
        QJsonObject params = searchParams(startMs, endMs);
        params.insert(QStringLiteral("feature"), m_feature);
        runStoppable(QStringLiteral("startReIdSearch"), QStringLiteral("stopReIdSearch"), params, stop,
                     startMs, endMs);
    }

    // Where a write that started and ended in these phases must be.
    static int vaultOf(int before, int after)
    {
        if (before == 0 && after == 0) {
            return OldVault;
        }
        if (before == 2 && after == 2) {
            return NewVault;
        }
        return EitherVault;
    }

    StoredItem newItem()
    {
        // Start times unique over the whole run, so that every item can be found by them.
        StoredItem item;
        item.nodeId = QStringLiteral("Cam%1").arg(m_index + 1);
        item.locId = m_location;
        item.start = kSeedStartMs + qint64(m_index) * 1000000000LL + qint64(++m_itemSequence) * 1000;
        item.end = item.start + 60000;
        item.type = pickUpTo(2);
        item.needBookmark = pickUpTo(4) == 0;
        return item;
    }

    static QJsonObject itemJson(const StoredItem& item)
    {
        return {{QStringLiteral("nodeID"), item.nodeId},
                {QStringLiteral("locID"), item.locId},
                {QStringLiteral("startTimestamp"), double(item.start)},
                {QStringLiteral("endTimestamp"), double(item.end)},
                {QStringLiteral("caseItemType"), item.type},
                {QStringLiteral("needBookmark"), item.needBookmark}};
    }

    void addCaseWithItem()
    {
        ++m_stats->caseCommands;
        StoredItem item = newItem();
        item.caseName = QStringLiteral("%1 case %2").arg(m_name).arg(m_itemSequence);
        const QJsonObject params{{QStringLiteral("caseName"), item.caseName},
                                 {QStringLiteral("reporter"), m_name},
                                 {QStringLiteral("caseItem"), itemJson(item)}};
        const int before = m_phase->load();
        const auto answer = post(m_network, m_port, envelope(QStringLiteral("addCaseWithItem"), params));
        waitFor({answer});
        const int after = m_phase->load();
        if (!checkFinal(QStringLiteral("addCaseWithItem"), *answer)) {
            return;
        }
        const QJsonObject final = answer->lines.last();
        if (final.value(QStringLiteral("code")).toString() != QLatin1String("0")) {
            return;
        }
        const QJsonObject payload = final.value(QStringLiteral("payload")).toObject();
        item.caseId = payload.value(QStringLiteral("caseId")).toInt();
        item.vault = vaultOf(before, after);
        if (item.caseId <= 0 || payload.value(QStringLiteral("caseName")).toString() != item.caseName) {
            m_stats->faults << QStringLiteral("%1 addCaseWithItem: acknowledged with a wrong case: %2")
                                   .arg(m_name, QString::fromUtf8(
                                                    QJsonDocument(payload).toJson(QJsonDocument::Compact)));
            return;
        }
        m_stats->cases << item;
    }

    // Adds to one of this client's cases that is known to be in the current vault: a case id
    // means nothing in the other vault.
    void addCaseItem()
    {
        const int phase = m_phase->load();
        QList<StoredItem> candidates;
        for (const StoredItem& stored : std::as_const(m_stats->cases)) {
            if ((phase == 0 && stored.vault == OldVault) || (phase == 2 && stored.vault == NewVault)) {
                candidates << stored;
            }
        }
        if (candidates.isEmpty()) {
            addCaseWithItem();
            return;
        }
        ++m_stats->caseCommands;
        const StoredItem owner = candidates.at(pickUpTo(int(candidates.size())));
        StoredItem item = newItem();
        item.caseId = owner.caseId;
        item.caseName = owner.caseName;
        QJsonObject params = itemJson(item);
        params.insert(QStringLiteral("caseId"), item.caseId);
        const auto answer = post(m_network, m_port, envelope(QStringLiteral("addCaseItem"), params));
        waitFor({answer});
        const int after = m_phase->load();
        if (!checkFinal(QStringLiteral("addCaseItem"), *answer) ||
            answer->lines.last().value(QStringLiteral("code")).toString() != QLatin1String("0")) {
            return;
        }
        item.vault = vaultOf(phase, after);
        if (item.vault == EitherVault) {
            // Sent to one vault, perhaps filed in the other, under whichever case has that id there.
            item.caseName.clear();
        }
        m_stats->items << item;
    }

    void readCases()
    {
        ++m_stats->caseCommands;
        if (m_stats->cases.isEmpty() || pickUpTo(2) == 0) {
            const auto answer =
                post(m_network, m_port, envelope(QStringLiteral("getCaseList"), QJsonObject()));
            waitFor({answer});
            checkFinal(QStringLiteral("getCaseList"), *answer);
            return;
        }
        const StoredItem& stored = m_stats->cases.at(pickUpTo(int(m_stats->cases.size())));
        const auto answer =
            post(m_network, m_port, envelope(QStringLiteral("retrieveCaseItemModel"), stored.caseId));
        waitFor({answer});
        checkFinal(QStringLiteral("retrieveCaseItemModel"), *answer);
    }

    const int m_index;
    const quint16 m_port;
    const qint64 m_deadlineMs;
    const std::atomic<int>* m_phase; // 0 first path, 1 changing, 2 second path
    ClientStats* m_stats;
    const QString m_name;
    const QString m_stopName;
    const QString m_location;
    std::mt19937 m_random;
    QNetworkAccessManager m_network;
    QJsonArray m_feature; // from one of this client's own hits, for re-identification
    int m_itemSequence = 0;
    int m_stoppedReplays = 0;
    int m_unstoppedReplays = 0;
};

struct VaultItem
{
    int caseId = 0;
    QString caseName;
    QString nodeId;
    QString locId;
    qint64 end = 0;
    int type = 0;
    bool needBookmark = false;
};

// The items of a vault file by start time, read without changing the file.
bool readVault(const QString& file, QMultiHash<qint64, VaultItem>* items, QString* error)
{
    const QString connection = QStringLiteral("load-vault-") + file;
    bool ok = false;
    {
        QSqlDatabase database = QSqlDatabase::addDatabase(QStringLiteral("QSQLITE"), connection);
        database.setDatabaseName(file);
        database.setConnectOptions(QStringLiteral("QSQLITE_OPEN_READONLY"));
        if (!database.open()) {
            *error = database.lastError().text();
        } else {
            QSqlQuery query(database);
            ok = query.exec(QStringLiteral(
                "SELECT CaseItem.caseId, \"Case\".name, nodeId, locationId, startTime, endTime, itemType, "
                "needBookmark FROM CaseItem JOIN \"Case\" ON \"Case\".id = CaseItem.caseId"));
            if (!ok) {
                *error = query.lastError().text();
            }
            while (ok && query.next()) {
                VaultItem item;
                item.caseId = query.value(0).toInt();
                item.caseName = query.value(1).toString();
                item.nodeId = query.value(2).toString();
                item.locId = query.value(3).toString();
                item.end = query.value(5).toLongLong();
                item.type = query.value(6).toInt();
                item.needBookmark = query.value(7).toBool();
                items->insert(query.value(4).toLongLong(), item);
            }
            database.close();
        }
    }
    QSqlDatabase::removeDatabase(connection);
    return ok;
}

// Empty when the item is where it must be with what the client sent; otherwise what is wrong.
QString findItem(const StoredItem& item, const QMultiHash<qint64, VaultItem> vaults[2])
{
    for (int vault = 0; vault < 2; ++vault) {
        if (item.vault != EitherVault && item.vault != vault) {
            continue;
        }
        for (auto it = vaults[vault].constFind(item.start);
             it != vaults[vault].cend() && it.key() == item.start; ++it) {
            const VaultItem& stored = it.value();
            if ((item.caseName.isEmpty() || stored.caseName == item.caseName) &&
                stored.nodeId == item.nodeId && stored.locId == item.locId && stored.end == item.end &&
                stored.type == item.type && stored.needBookmark == item.needBookmark &&
                (item.vault == EitherVault || stored.caseId == item.caseId)) {
                return QString();
            }
        }
    }
    return QStringLiteral("%1 (case %2 \"%3\", starting %4, vault %5) is not in the vault")
        .arg(item.nodeId)
        .arg(item.caseId)
        .arg(item.caseName)
        .arg(item.start)
        .arg(item.vault == OldVault   ? QStringLiteral("first")
             : item.vault == NewVault ? QStringLiteral("second")
                                      : QStringLiteral("either"));
}

// A site of `cameras` single-channel cameras, one location each (Loc1..LocN).
QByteArray generatedSite(int cameras)
{
    QJsonArray list;
    for (int i = 1; i <= cameras; ++i) {
        // Distinct ports make distinct simulated cameras; the runner replaces them with free ones.
        list.append(QJsonObject{{QStringLiteral("name"), QStringLiteral("Cam%1").arg(i)},
                                {QStringLiteral("port"), 20000 + i},
                                // Cameras answer only with credentials.
                                {QStringLiteral("user"), QStringLiteral("admin")},
                                {QStringLiteral("password"), QStringLiteral("cam-%1-pw").arg(i)},
                                {QStringLiteral("location"), QStringLiteral("Loc%1").arg(i)},
                                {QStringLiteral("groupId"), 1 + i % 4}});
    }
    return QJsonDocument(QJsonObject{{QStringLiteral("serverId"), QStringLiteral("load-site")},
                                     {QStringLiteral("cameras"), list}})
        .toJson();
}

bool writeFile(const QString& path, const QByteArray& content)
{
    QFile file(path);
    return file.open(QIODevice::WriteOnly | QIODevice::Truncate) && file.write(content) == content.size();
}

} // namespace

TEST(LoadTest, ManyClientsWhileSynchronisingAndMovingTheDatabase)
{
    const int clients = envInt("DELVIX_LOAD_CLIENTS", 8);
    const int seconds = envInt("DELVIX_LOAD_SECONDS", 20);
    const int objects = envInt("DELVIX_LOAD_OBJECTS", 10000);
    const int cameras = envInt("DELVIX_LOAD_CAMERAS", 0);
    QTemporaryDir data;
    ASSERT_TRUE(data.isValid());
    const QString dataDir = data.path();

    // One seeded location per client, so that each client's hits are recognisably its own. The
    // site's cameras record at the same location names, but now, while the seeded objects are
    // from 2024: the synchronised objects never fall into a client's windows.
    QElapsedTimer seedTimer;
    seedTimer.start();
    QProcess seed;
    seed.start(QStringLiteral(DELVIX_HOST_PATH),
               {QStringLiteral("seed"), QStringLiteral("--data"), dataDir, QStringLiteral("--objects"),
                QString::number(objects), QStringLiteral("--locations"), QString::number(clients),
                QStringLiteral("--seed"), QStringLiteral("7")});
    ASSERT_TRUE(seed.waitForFinished(1800000 * kTimeScale));
    ASSERT_EQ(seed.exitCode(), 0) << seed.readAllStandardError().constData();
    const qint64 seedMs = seedTimer.elapsed();

    // The synchroniser reads its settings from the working directory: a pass every 2 s.
    ASSERT_TRUE(writeFile(QDir(dataDir).filePath(QStringLiteral("routineSyncTimeBuffer.txt")), "2\n"));
    ASSERT_TRUE(writeFile(QDir(dataDir).filePath(QStringLiteral("getObjectDataTimeBuffer.txt")), "0\n"));
    QStringList serveArgs{QStringLiteral("serve"), QStringLiteral("--data"), dataDir,
                          QStringLiteral("--listen"), QStringLiteral("127.0.0.1:0")};
    QStringList siteLocations;
    if (cameras > 0) {
        const QString siteFile = QDir(dataDir).filePath(QStringLiteral("site.json"));
        ASSERT_TRUE(writeFile(siteFile, generatedSite(cameras)));
        serveArgs << QStringLiteral("--site") << siteFile;
        for (int i = 1; i <= cameras; ++i) {
            siteLocations << QStringLiteral("Loc%1").arg(i);
        }
    } else {
        // The built-in site's cameras that record and are online.
        siteLocations = QStringList{QStringLiteral("Loc1"), QStringLiteral("Loc2"), QStringLiteral("Loc3"),
                                    QStringLiteral("Loc4"), QStringLiteral("Loc5")};
    }

    QProcess serve;
    serve.setWorkingDirectory(dataDir);
    serve.setProgram(QStringLiteral(DELVIX_HOST_PATH));
    serve.setArguments(serveArgs);
    serve.setProcessChannelMode(QProcess::SeparateChannels);
    serve.setStandardErrorFile(QDir(dataDir).filePath(QStringLiteral("serve.log")));
    serve.start();
    ASSERT_TRUE(serve.waitForStarted());
    const qint64 pid = serve.processId();
    quint16 port = 0;
    QByteArray banner;
    QElapsedTimer startTimer;
    startTimer.start();
    const QRegularExpression bannerPort(QStringLiteral("http://127\\.0\\.0\\.1:(\\d+)"));
    while (port == 0 && startTimer.elapsed() < 30000 * kTimeScale && serve.state() == QProcess::Running) {
        serve.waitForReadyRead(100);
        banner += serve.readAllStandardOutput();
        port = bannerPort.match(QString::fromUtf8(banner)).captured(1).toUShort();
    }
    ASSERT_NE(port, 0) << banner.constData();
    const qint64 serveStartMs = QDateTime::currentMSecsSinceEpoch();

    // The clients, each on its own thread with its own connection manager.
    std::atomic<int> phase{0};
    const qint64 deadlineMs = serveStartMs + seconds * 1000LL;
    std::vector<ClientStats> stats(static_cast<size_t>(clients));
    std::vector<std::unique_ptr<QThread>> threads;
    for (int i = 0; i < clients; ++i) {
        ClientStats* clientStats = &stats[size_t(i)];
        threads.emplace_back(QThread::create([i, port, deadlineMs, &phase, clientStats]() {
            LoadClient client(i, port, deadlineMs, &phase, clientStats);
            client.run();
        }));
        threads.back()->start();
    }

    // A quarter in, the resident size the server settled at; half-way, the database path moves.
    QNetworkAccessManager network;
    sleepOnLoop(seconds * 250);
    const qint64 settledRssKb = procStatusKb(pid, "VmRSS");
    sleepOnLoop(seconds * 250);
    const QString secondPath = QDir(dataDir).filePath(QStringLiteral("database2"));
    phase = 1;
    QNetworkRequest moveRequest(QUrl(QStringLiteral("http://127.0.0.1:%1/host/databasePath").arg(port)));
    moveRequest.setHeader(QNetworkRequest::ContentTypeHeader, QStringLiteral("application/json"));
    QNetworkReply* move =
        network.post(moveRequest, QJsonDocument(QJsonObject{{QStringLiteral("path"), secondPath}}).toJson());
    {
        QEventLoop loop;
        QObject::connect(move, &QNetworkReply::finished, &loop, &QEventLoop::quit);
        loop.exec();
    }
    EXPECT_EQ(move->attribute(QNetworkRequest::HttpStatusCodeAttribute).toInt(), 200)
        << move->readAll().constData();
    move->deleteLater();
    phase = 2;

    bool allJoined = true;
    for (const auto& thread : threads) {
        while (!thread->wait(QDeadlineTimer(50))) {
            QCoreApplication::processEvents();
            if (QDateTime::currentMSecsSinceEpoch() > deadlineMs + kRequestTimeoutMs + 60000 * kTimeScale) {
                allJoined = false;
                break;
            }
        }
    }
    ASSERT_TRUE(allJoined) << "a client never finished";
    const double loadSeconds = double(QDateTime::currentMSecsSinceEpoch() - serveStartMs) / 1000.0;

    // The synchroniser ran meanwhile: the site's cameras' objects of this run are in the store.
    auto syncAnswer =
        post(network, port,
             QJsonObject{
                 {QStringLiteral("command"), QStringLiteral("startSearch")},
                 {QStringLiteral("client"), QStringLiteral("load-sync-check")},
                 {QStringLiteral("wait"), kFirstReplyWaitSeconds},
                 {QStringLiteral("params"),
                  QJsonObject{{QStringLiteral("startTimestamp"), double(serveStartMs - 3600 * 1000LL)},
                              {QStringLiteral("endTimestamp"), double(QDateTime::currentMSecsSinceEpoch())},
                              {QStringLiteral("locIDList"), QJsonArray::fromStringList(siteLocations)}}}});
    waitFor({syncAnswer});
    const qsizetype synchronisedHits = std::max<qsizetype>(0, syncAnswer->lines.size() - 1);
    EXPECT_GT(synchronisedHits, 0) << "nothing the cameras recorded during the run was found; see "
                                   << qPrintable(QDir(dataDir).filePath(QStringLiteral("serve.log")));

    // The compared searches again, one at a time: unstopped ones must find exactly as much.
    int replayed = 0;
    int cutShort = 0;
    int stoppedReplayed = 0;
    QStringList replayFaults;
    for (const ClientStats& s : stats) {
        for (const Replay& replay : s.replays) {
            const auto again = post(network, port,
                                    QJsonObject{{QStringLiteral("command"), replay.command},
                                                {QStringLiteral("client"), QStringLiteral("load-replay")},
                                                {QStringLiteral("wait"), kFirstReplyWaitSeconds},
                                                {QStringLiteral("params"), replay.params}});
            waitFor({again});
            const qsizetype hits = again->lines.size() - 1;
            if (replay.stopped) {
                ++stoppedReplayed;
                cutShort += hits > replay.hits ? 1 : 0;
            } else {
                ++replayed;
                if (hits != replay.hits) {
                    replayFaults
                        << QStringLiteral("%1 with %2 hit(s) under load finds %3 alone: %4")
                               .arg(replay.command)
                               .arg(replay.hits)
                               .arg(hits)
                               .arg(QString::fromUtf8(
                                   QJsonDocument(replay.params).toJson(QJsonDocument::Compact).left(200)));
                }
            }
        }
    }

    const qint64 endRssKb = procStatusKb(pid, "VmRSS");
    const qint64 peakRssKb = procStatusKb(pid, "VmHWM");
    ::kill(pid_t(pid), SIGTERM);
    ASSERT_TRUE(serve.waitForFinished(60000 * kTimeScale)) << "the server did not stop on SIGTERM";
    EXPECT_EQ(serve.exitStatus(), QProcess::NormalExit);
    EXPECT_EQ(serve.exitCode(), 0);
    const QRegularExpressionMatch servedMatch =
        QRegularExpression(QStringLiteral("stopping after (\\d+) request"))
            .match(QString::fromUtf8(serve.readAllStandardOutput()));
    const int servedByServer = servedMatch.captured(1).toInt();

    ClientStats total;
    QStringList faults = replayFaults;
    for (const ClientStats& s : stats) {
        total.sent += s.sent;
        total.finals += s.finals;
        total.silentEnds += s.silentEnds;
        total.searches += s.searches;
        total.stoppedSearches += s.stoppedSearches;
        total.reIdSearches += s.reIdSearches;
        total.caseCommands += s.caseCommands;
        total.hits += s.hits;
        total.cases += s.cases;
        total.items += s.items;
        for (auto it = s.failureCodes.cbegin(); it != s.failureCodes.cend(); ++it) {
            total.failureCodes[it.key()] += it.value();
        }
        faults += s.faults;
    }

    // Every acknowledged case and item, in the vault it must be in, with what was sent.
    QMultiHash<qint64, VaultItem> vaults[2];
    QString error;
    const QString vaultFiles[2] = {
        QDir(dataDir).filePath(QStringLiteral("database/PluginDelvix/CaseVault.db")),
        QDir(secondPath).filePath(QStringLiteral("PluginDelvix/CaseVault.db"))};
    for (int vault = 0; vault < 2; ++vault) {
        EXPECT_TRUE(readVault(vaultFiles[vault], &vaults[vault], &error))
            << qPrintable(vaultFiles[vault]) << ": " << qPrintable(error);
    }
    int missing = 0;
    for (const StoredItem& item : std::as_const(total.cases) + total.items) {
        const QString problem = findItem(item, vaults);
        if (!problem.isEmpty()) {
            ++missing;
            faults << problem;
        }
    }

    std::printf("\nLoad test report\n"
                "  size: %d clients, %d s, %d seeded objects, %s\n"
                "  seeding: %.1f s\n"
                "  requests: %d sent, %d ended with their final reply, %d stops ended (no reply by design)\n"
                "  served: %d (server's count), %.1f requests/s over %.1f s\n"
                "  mix: %d searches, %d stopped searches, %d re-identifications, %d case commands, %d hits\n"
                "  cases: %lld acknowledged, %lld items added later, %d missing; vault entries %lld + %lld\n"
                "  stops: %d of %d stopped searches run again alone found more (cut short by the stop); "
                "%d unstopped searches run again alone found the same\n"
                "  synchroniser: %lld objects of this run found at the site's locations\n"
                "  server memory: peak RSS %.1f MB, RSS a quarter in %.1f MB, at the end %.1f MB\n",
                clients, seconds, objects,
                cameras > 0 ? qPrintable(QStringLiteral("%1 cameras").arg(cameras)) : "built-in site",
                double(seedMs) / 1000.0, total.sent, total.finals, total.silentEnds, servedByServer,
                double(total.sent) / loadSeconds, loadSeconds, total.searches, total.stoppedSearches,
                total.reIdSearches, total.caseCommands, total.hits,
                static_cast<long long>(total.cases.size()), static_cast<long long>(total.items.size()),
                missing, static_cast<long long>(vaults[0].size()), static_cast<long long>(vaults[1].size()),
                cutShort, stoppedReplayed, replayed - int(replayFaults.size()),
                static_cast<long long>(synchronisedHits), double(peakRssKb) / 1024.0,
                double(settledRssKb) / 1024.0, double(endRssKb) / 1024.0);
    for (auto it = total.failureCodes.cbegin(); it != total.failureCodes.cend(); ++it) {
        std::printf("  answered other than \"0\": %s x%d\n", qPrintable(it.key()), it.value());
    }
    for (const QString& fault : std::as_const(faults).mid(0, 20)) {
        std::printf("  FAULT: %s\n", qPrintable(fault));
    }
    std::fflush(stdout);

    EXPECT_TRUE(faults.isEmpty()) << faults.size() << " fault(s), the first: " << qPrintable(faults.value(0));
    EXPECT_EQ(total.finals + total.silentEnds, total.sent);
    EXPECT_GT(total.hits, 0);
    EXPECT_GT(total.cases.size(), 0);
    // Every kind of request was in the mix.
    EXPECT_GT(total.searches, 0);
    EXPECT_GT(total.stoppedSearches, 0);
    EXPECT_GT(total.reIdSearches, 0);
    EXPECT_GT(total.items.size(), 0);
    EXPECT_GE(servedByServer, total.sent);
#ifndef DELVIX_LOAD_INSTRUMENTED
    // Flat memory, with room for caches and allocator slack: no steady growth with the requests.
    EXPECT_LT(endRssKb, std::max(settledRssKb * 2, settledRssKb + 256 * 1024))
        << "server memory grew from " << settledRssKb << " kB to " << endRssKb << " kB";
#endif
    if (::testing::Test::HasFailure()) {
        data.setAutoRemove(false); // the server's log and both vaults, for a look
        std::printf("  data folder kept: %s\n", qPrintable(dataDir));
    }
}
