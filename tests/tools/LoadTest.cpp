// The whole system under load, as a person runs it: `delvix-host serve` on a seeded store, many
// clients at once (searches, some stopped by their client, re-identifications and case commands),
// the synchroniser pulling from the site's cameras, and the database path moved half-way. Every
// request must end with its final reply, every acknowledged case item must be in the vault it
// belongs to as sent, no client may see another's hits, an unstopped search must find alone what
// it found under load, and the server's memory must not keep growing.
//
// Sizes from the environment, with defaults small enough for CI on two cores:
//   DELVIX_LOAD_CLIENTS (8)  DELVIX_LOAD_SECONDS (20)  DELVIX_LOAD_OBJECTS (10000)
//   DELVIX_LOAD_CAMERAS (0: the built-in site; N: a generated site of N cameras at Loc1..LocN)
// scripts/load-test.sh runs it at full size and shows the report it prints.

#include "ServeClient.h"
#include "TestWait.h"

#include <QDateTime>
#include <QDir>
#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QMap>
#include <QTemporaryDir>
#include <atomic>
#include <cstdio>
#include <gtest/gtest.h>
#include <random>

namespace {

// The seeder spreads each location's objects over four hours from this time.
constexpr qint64 kSeedStartMs = 1704067200000LL;
constexpr qint64 kSeedSpanMs = 4 * 3600 * 1000LL;
// Searches run one at a time, so under load one may wait its turn for many seconds: the API's
// default first-reply wait of 2 s would end its answer empty.
constexpr double kFirstReplyWait = 90.0 * kTimeScale;
constexpr int kKinds = 6; // search, stopped search, re-identification, new case, new item, read

enum Vault
{
    OldVault,
    NewVault,
    EitherVault // the request overlapped the move
};

struct Replay
{
    QString command;
    QJsonObject params;
    qsizetype hits;
};

struct ClientStats
{
    int sent = 0, finals = 0, stopsEnded = 0, searches = 0, stopped = 0, reIds = 0, caseCommands = 0,
        hits = 0;
    QMap<QString, int> otherCodes; // "command code" -> count, for the report
    QStringList faults;
    QList<std::pair<CaseEntry, Vault>> written; // acknowledged cases and items
    QList<Replay> replays;
};

qint64 now()
{
    return QDateTime::currentMSecsSinceEpoch();
}

// Lets time pass with this thread's event loop turning.
void pause(int ms)
{
    const qint64 until = now() + ms;
    waitFor([until]() { return now() >= until; }, ms + 1000);
}

class LoadClient
{
public:
    LoadClient(int index, quint16 port, qint64 deadline, const std::atomic<int>* phase, ClientStats* stats)
        : m_index(index)
        , m_deadline(deadline)
        , m_phase(phase)
        , m_stats(*stats)
        , m_http(port)
        , m_name(QStringLiteral("load-client-%1").arg(index))
        , m_location(QStringLiteral("Loc%1").arg(index + 1))
        , m_random(std::mt19937::result_type(1000 + index))
    {}

    void run()
    {
        // A first round of every kind, each client starting at another, so that even a short run
        // has all kinds in flight at once (the sanitizer runs count on that); then a random mix.
        for (int i = 0; i < kKinds && now() < m_deadline; ++i) {
            send((m_index + i) % kKinds);
        }
        while (now() < m_deadline) {
            const int pick = pickUpTo(100);
            send(pick < 30 ? 0 : pick < 45 ? 1 : pick < 60 ? 2 : pick < 80 ? 3 : pick < 92 ? 4 : 5);
        }
    }

private:
    int pickUpTo(int bound) { return std::uniform_int_distribution<int>(0, bound - 1)(m_random); }

    void send(int kind)
    {
        if (kind < 2 || (kind == 2 && m_feature.isEmpty())) {
            search(QStringLiteral("startSearch"), kind == 1);
        } else if (kind == 2) {
            search(QStringLiteral("startReIdSearch"), pickUpTo(3) == 0);
        } else if (kind == 5 && !m_cases.isEmpty() && pickUpTo(2) == 0) {
            ++m_stats.caseCommands;
            finished(m_http.call(QStringLiteral("retrieveCaseItemModel"),
                                 m_cases.at(pickUpTo(int(m_cases.size()))).first.caseId, m_name));
        } else if (kind == 5) {
            ++m_stats.caseCommands;
            finished(m_http.call(QStringLiteral("getCaseList"), QJsonObject(), m_name));
        } else {
            write(kind == 4);
        }
    }

    // A request must end with exactly one final reply, as its last line; false otherwise and
    // when it failed.
    bool finished(const ServeAnswer& answer, const QString& command = QString())
    {
        ++m_stats.sent;
        if (answer.status != 200 || answer.error != QNetworkReply::NoError || answer.finalCount() != 1 ||
            !answer.lines.last()[QStringLiteral("final")].toBool()) {
            m_stats.faults << QStringLiteral("%1 %2: no final reply (HTTP %3, error %4, %5 line(s))")
                                  .arg(m_name, command)
                                  .arg(answer.status)
                                  .arg(answer.error)
                                  .arg(answer.lines.size());
            return false;
        }
        ++m_stats.finals;
        if (answer.code() != QLatin1String("0")) {
            ++m_stats.otherCodes[command + QLatin1Char(' ') + answer.code()];
        }
        return answer.code() == QLatin1String("0");
    }

    void search(const QString& command, bool stop)
    {
        const bool reId = command == QLatin1String("startReIdSearch");
        ++(reId ? m_stats.reIds : stop ? m_stats.stopped : m_stats.searches);
        // Longer windows when stopped or re-identifying, so that the stop usually meets a running search.
        const qint64 length = stop || reId ? 3600 * 1000LL : 600 * 1000LL;
        const qint64 start =
            kSeedStartMs + std::uniform_int_distribution<qint64>(0, kSeedSpanMs - length)(m_random);
        QJsonObject params{{QStringLiteral("startTimestamp"), double(start)},
                           {QStringLiteral("endTimestamp"), double(start + length)},
                           {QStringLiteral("locIDList"), QJsonArray{m_location}}};
        if (reId) {
            params[QStringLiteral("feature")] = m_feature;
        } else if (pickUpTo(2) == 0) {
            params[QStringLiteral("humanInfo")] = QStringLiteral("{\"Gender\":%1}").arg(1 + pickUpTo(2));
        }
        // Stopped searches go under a second name: a stop's answer ends before the plug-in may have
        // handled it, and a late stop must not reach this client's next search.
        const QString name = stop ? m_name + QStringLiteral("-stops") : m_name;
        const ServeAnswerPtr answer = m_http.request(command, params, name, kFirstReplyWait);
        if (stop) {
            pause(10 + pickUpTo(150));
            const QString stopCommand =
                reId ? QStringLiteral("stopReIdSearch") : QStringLiteral("stopSearch");
            const ServeAnswer stopped = m_http.call(stopCommand, QJsonObject(), name, 0.2);
            ++m_stats.sent;
            if (stopped.status == 200 && stopped.error == QNetworkReply::NoError) {
                ++m_stats.stopsEnded;
            } else {
                m_stats.faults << QStringLiteral("%1 %2: answer did not end cleanly (HTTP %3, error %4)")
                                      .arg(name, stopCommand)
                                      .arg(stopped.status)
                                      .arg(stopped.error);
            }
        }
        ServeConnection::wait({answer});
        if (!finished(*answer, command)) {
            return;
        }
        // Every hit from this client's own location, overlapping its window (the store keeps seconds).
        for (const QJsonObject& line : std::as_const(answer->lines).mid(0, answer->lines.size() - 1)) {
            const QJsonObject hit = line[QStringLiteral("payload")].toObject();
            const qint64 hitStart = hit[QStringLiteral("startTimestamp")].toInteger();
            const qint64 hitEnd = hit[QStringLiteral("endTimestamp")].toInteger(hitStart);
            ++m_stats.hits;
            if (hit[QStringLiteral("locID")] != m_location || hitStart > start + length + 999 ||
                hitEnd < start - 999) {
                m_stats.faults << QStringLiteral("%1 %2: foreign hit %3 %4..%5 (asked %6 %7..%8)")
                                      .arg(m_name, command, hit[QStringLiteral("locID")].toString())
                                      .arg(hitStart)
                                      .arg(hitEnd)
                                      .arg(m_location)
                                      .arg(start)
                                      .arg(start + length);
            } else if (hit[QStringLiteral("feature")].toArray().size() == 512) {
                m_feature = hit[QStringLiteral("feature")].toArray();
            }
        }
        if (!stop && m_replays++ < 6) {
            m_stats.replays << Replay{command, params, answer->lines.size() - 1};
        }
    }

    // A new case with one item, or an item for one of this client's cases known to be in the
    // current vault (a case id means nothing in the other one).
    void write(bool toExistingCase)
    {
        ++m_stats.caseCommands;
        const int before = m_phase->load();
        CaseEntry item{0,
                       QStringLiteral("%1 case %2").arg(m_name).arg(++m_sequence),
                       QStringLiteral("Cam%1").arg(m_index + 1),
                       m_location,
                       kSeedStartMs + m_index * 1000000000LL + m_sequence * 1000LL,
                       0,
                       pickUpTo(2),
                       pickUpTo(4) == 0};
        item.end = item.start + 60000;
        QJsonObject params{{QStringLiteral("caseName"), item.caseName},
                           {QStringLiteral("reporter"), m_name},
                           {QStringLiteral("caseItem"), item.itemJson()}};
        QList<CaseEntry> owners;
        for (const auto& [owner, vault] : std::as_const(m_cases)) {
            if ((before == 0 && vault == OldVault) || (before == 2 && vault == NewVault)) {
                owners << owner;
            }
        }
        if (toExistingCase && !owners.isEmpty()) {
            const CaseEntry& owner = owners.at(pickUpTo(int(owners.size())));
            item.caseId = owner.caseId;
            item.caseName = owner.caseName;
            params = item.itemJson();
            params[QStringLiteral("caseId")] = item.caseId;
        }
        const QString command =
            item.caseId ? QStringLiteral("addCaseItem") : QStringLiteral("addCaseWithItem");
        const ServeAnswer answer = m_http.call(command, params, m_name, kFirstReplyWait);
        const int after = m_phase->load();
        if (!finished(answer, command)) {
            return;
        }
        const Vault vault = before == 0 && after == 0 ? OldVault : before == 2 ? NewVault : EitherVault;
        if (item.caseId == 0) {
            item.caseId = answer.payload()[QStringLiteral("caseId")].toInt();
            if (item.caseId <= 0 || answer.payload()[QStringLiteral("caseName")] != item.caseName) {
                m_stats.faults << QStringLiteral("%1 %2: acknowledged with a wrong case: %3")
                                      .arg(m_name, command,
                                           QString::fromUtf8(
                                               QJsonDocument(answer.payload().toObject()).toJson()));
                return;
            }
            m_cases << std::pair(item, vault);
        }
        if (vault == EitherVault) {
            // Perhaps filed in the other vault, under whichever case has that id there.
            item.caseId = 0;
            item.caseName = command == QLatin1String("addCaseItem") ? QString() : item.caseName;
        }
        m_stats.written << std::pair(item, vault);
    }

    const int m_index;
    const qint64 m_deadline;
    const std::atomic<int>* m_phase; // 0 first path, 1 moving, 2 second path
    ClientStats& m_stats;
    ServeConnection m_http;
    const QString m_name;
    const QString m_location;
    std::mt19937 m_random;
    QJsonArray m_feature;                       // from one of this client's own hits, for re-identification
    QList<std::pair<CaseEntry, Vault>> m_cases; // made by this client
    int m_sequence = 0;
    int m_replays = 0;
};

int envInt(const char* name, int fallback)
{
    const int value = qEnvironmentVariableIntValue(name);
    return value > 0 ? value : fallback;
}

bool writeFile(const QString& path, const QByteArray& content)
{
    QFile file(path);
    return file.open(QIODevice::WriteOnly) && file.write(content) == content.size();
}

} // namespace

TEST(HostLoad, ManyClientsWhileSynchronisingAndMovingTheDatabase)
{
    const int clients = envInt("DELVIX_LOAD_CLIENTS", 8);
    const int seconds = envInt("DELVIX_LOAD_SECONDS", 20);
    const int objects = envInt("DELVIX_LOAD_OBJECTS", 10000);
    const int cameras = envInt("DELVIX_LOAD_CAMERAS", 0);
    QTemporaryDir data;
    const QDir dir(data.path());

    // One seeded location per client, so that each client's hits are recognisably its own. The
    // site's cameras record at the same names, but now: their objects never fall into the 2024 windows.
    const qint64 seedStart = now();
    QProcess seed;
    seed.start(QStringLiteral(DELVIX_HOST_PATH),
               {QStringLiteral("seed"), QStringLiteral("--data"), data.path(), QStringLiteral("--objects"),
                QString::number(objects), QStringLiteral("--locations"), QString::number(clients),
                QStringLiteral("--seed"), QStringLiteral("7")});
    ASSERT_TRUE(seed.waitForFinished(scaledMs(1800000)));
    ASSERT_EQ(seed.exitCode(), 0) << seed.readAllStandardError().constData();
    const double seedSeconds = double(now() - seedStart) / 1000.0;

    // The synchroniser reads its settings from the working directory: a pass every 2 s.
    ASSERT_TRUE(writeFile(dir.filePath(QStringLiteral("routineSyncTimeBuffer.txt")), "2\n"));
    ASSERT_TRUE(writeFile(dir.filePath(QStringLiteral("getObjectDataTimeBuffer.txt")), "0\n"));
    QStringList extra;
    QJsonArray siteLocations{QStringLiteral("Loc1"), QStringLiteral("Loc2"), QStringLiteral("Loc3"),
                             QStringLiteral("Loc4"),
                             QStringLiteral("Loc5")}; // the built-in site's that record
    if (cameras > 0) {
        QJsonArray list;
        siteLocations = QJsonArray();
        for (int i = 1; i <= cameras; ++i) {
            // Distinct ports make distinct cameras; the host replaces them with free ones.
            list.append(QJsonObject{{QStringLiteral("name"), QStringLiteral("Cam%1").arg(i)},
                                    {QStringLiteral("port"), 20000 + i},
                                    {QStringLiteral("user"), QStringLiteral("admin")},
                                    {QStringLiteral("password"), QStringLiteral("cam-%1-pw").arg(i)},
                                    {QStringLiteral("location"), QStringLiteral("Loc%1").arg(i)},
                                    {QStringLiteral("groupId"), 1 + i % 4}});
            siteLocations.append(QStringLiteral("Loc%1").arg(i));
        }
        extra << QStringLiteral("--site") << dir.filePath(QStringLiteral("site.json"));
        ASSERT_TRUE(writeFile(extra.last(),
                              QJsonDocument(QJsonObject{{QStringLiteral("serverId"), QStringLiteral("load")},
                                                        {QStringLiteral("cameras"), list}})
                                  .toJson()));
    }

    ServeProcess serve;
    ASSERT_TRUE(serve.start(data.path(), extra)) << qPrintable(serve.log());
    const qint64 serveStart = now();
    std::atomic<int> phase{0};
    std::vector<ClientStats> stats(static_cast<size_t>(clients));
    qint64 settledKb = 0;
    {
        ClientThreads threads(clients, [&](int i) {
            LoadClient(i, serve.port(), serveStart + seconds * 1000LL, &phase, &stats[size_t(i)]).run();
        });
        // A quarter in, the memory the server settled at; half-way, the database path moves.
        pause(seconds * 250);
        settledKb = serve.memoryKb("VmRSS");
        pause(seconds * 250);
        phase = 1;
        const ServeAnswerPtr move = serve.http().post(
            QStringLiteral("/host/databasePath"),
            QJsonDocument(QJsonObject{{QStringLiteral("path"), dir.filePath(QStringLiteral("database2"))}})
                .toJson());
        ServeConnection::wait({move});
        EXPECT_EQ(move->status, 200);
        phase = 2;
        ASSERT_TRUE(threads.join(seconds * 1000 + 300000)) << "a client never finished";
    }
    const double loadSeconds = double(now() - serveStart) / 1000.0;

    // The synchroniser ran meanwhile: what the site's cameras recorded in this run is in the store.
    const QJsonObject recent{{QStringLiteral("startTimestamp"), double(serveStart - 3600 * 1000LL)},
                             {QStringLiteral("endTimestamp"), double(now())},
                             {QStringLiteral("locIDList"), siteLocations}};
    const qsizetype synchronised =
        serve.http()
            .call(QStringLiteral("startSearch"), recent, QStringLiteral("sync-check"), kFirstReplyWait)
            .lines.size() -
        1;
    EXPECT_GT(synchronised, 0) << "nothing recorded during the run was found; see "
                               << qPrintable(serve.log());

    // The unstopped searches again, one at a time: each finds exactly what it found under load.
    ClientStats total;
    int replayed = 0;
    for (const ClientStats& s : stats) {
        for (const Replay& replay : s.replays) {
            const qsizetype hits =
                serve.http()
                    .call(replay.command, replay.params, QStringLiteral("replay"), kFirstReplyWait)
                    .lines.size() -
                1;
            ++replayed;
            if (hits != replay.hits) {
                total.faults << QStringLiteral("%1 with %2 hit(s) under load finds %3 alone: %4")
                                    .arg(replay.command)
                                    .arg(replay.hits)
                                    .arg(hits)
                                    .arg(QString::fromUtf8(QJsonDocument(replay.params).toJson().left(200)));
            }
        }
    }

    const qint64 endKb = serve.memoryKb("VmRSS");
    const qint64 peakKb = serve.memoryKb("VmHWM");
    ASSERT_TRUE(serve.stop()) << "the server did not stop cleanly on SIGTERM";
    for (const ClientStats& s : stats) {
        for (int ClientStats::*field :
             {&ClientStats::sent, &ClientStats::finals, &ClientStats::stopsEnded, &ClientStats::searches,
              &ClientStats::stopped, &ClientStats::reIds, &ClientStats::caseCommands, &ClientStats::hits}) {
            total.*field += s.*field;
        }
        for (auto it = s.otherCodes.cbegin(); it != s.otherCodes.cend(); ++it) {
            total.otherCodes[it.key()] += it.value();
        }
        total.faults += s.faults;
        total.written += s.written;
    }

    // Every acknowledged case and item in the vault it belongs to, as sent.
    QHash<qint64, CaseEntry> vaults[2];
    for (const QString& file : {dir.filePath(QStringLiteral("database/PluginDelvix/CaseVault.db")),
                                dir.filePath(QStringLiteral("database2/PluginDelvix/CaseVault.db"))}) {
        QString error;
        EXPECT_TRUE(readVault(file, &vaults[file.contains(QLatin1String("database2"))], &error))
            << qPrintable(file) << ": " << qPrintable(error);
    }
    int missing = 0;
    for (const auto& [sent, vault] : std::as_const(total.written)) {
        if (!(vault != NewVault && sent.sameItem(vaults[0].value(sent.start))) &&
            !(vault != OldVault && sent.sameItem(vaults[1].value(sent.start)))) {
            ++missing;
            total.faults << QStringLiteral("%1 (case %2, starting %3, vault %4) is not in its vault as sent")
                                .arg(sent.nodeId)
                                .arg(sent.caseId)
                                .arg(sent.start)
                                .arg(int(vault));
        }
    }

    std::printf(
        "\nLoad test report\n"
        "  size: %d clients, %d s, %d seeded objects (seeded in %.1f s), %d cameras (0: built-in site)\n"
        "  requests: %d sent, %d ended with their final reply, %d stops ended (no reply by design)\n"
        "  served: %d (server's count), %.1f requests/s over %.1f s\n"
        "  mix: %d searches, %d stopped, %d re-identifications, %d case commands, %d hits; "
        "%d searches run again alone\n"
        "  vaults: %lld acknowledged cases and items checked, %d missing; entries %lld + %lld\n"
        "  synchroniser: %lld objects of this run found at the site's locations\n"
        "  server memory: peak RSS %.1f MB, a quarter in %.1f MB, at the end %.1f MB\n",
        clients, seconds, objects, seedSeconds, cameras, total.sent, total.finals, total.stopsEnded,
        serve.requestsServed(), double(total.sent) / loadSeconds, loadSeconds, total.searches, total.stopped,
        total.reIds, total.caseCommands, total.hits, replayed, static_cast<long long>(total.written.size()),
        missing, static_cast<long long>(vaults[0].size()), static_cast<long long>(vaults[1].size()),
        static_cast<long long>(synchronised), double(peakKb) / 1024.0, double(settledKb) / 1024.0,
        double(endKb) / 1024.0);
    for (auto it = total.otherCodes.cbegin(); it != total.otherCodes.cend(); ++it) {
        std::printf("  answered other than \"0\": %s x%d\n", qPrintable(it.key()), it.value());
    }
    for (const QString& fault : std::as_const(total.faults).mid(0, 20)) {
        std::printf("  FAULT: %s\n", qPrintable(fault));
    }
    std::fflush(stdout);

    EXPECT_TRUE(total.faults.isEmpty())
        << total.faults.size() << " fault(s), the first: " << qPrintable(total.faults.value(0));
    EXPECT_EQ(total.finals + total.stopsEnded, total.sent);
    EXPECT_GE(serve.requestsServed(), total.sent);
    // Every kind of request was in the mix, and found or stored something.
    for (const int count :
         {total.hits, total.searches, total.stopped, total.reIds, int(total.written.size())}) {
        EXPECT_GT(count, 0);
    }
    // Flat memory with room for caches and allocator slack; instrumented builds keep shadow memory
    // and quarantined blocks, so there it is only reported.
    if (kTimeScale == 1) {
        EXPECT_LT(endKb, std::max(settledKb * 2, settledKb + 256 * 1024)) << "from " << settledKb << " kB";
    }
    if (::testing::Test::HasFailure()) {
        data.setAutoRemove(false); // the server's log and both vaults, for a look
        std::printf("  data folder kept: %s\n", qPrintable(data.path()));
    }
}
