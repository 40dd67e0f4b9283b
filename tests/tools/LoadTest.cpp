// The whole system under load, as a person runs it: `delvix-host serve` on a seeded store, many
// clients at once (searches, some stopped by their client, re-identifications and case commands),
// the synchroniser pulling from the site's cameras, and the database path moved half-way. Every
// request must end with its final reply, every acknowledged case item must be in the vault it
// belongs to as sent, no client may see another's hits, and the server's memory must not keep growing.
//
// Sizes from the environment, with defaults small enough for CI on two cores:
//   DELVIX_LOAD_CLIENTS (8)  DELVIX_LOAD_SECONDS (20)  DELVIX_LOAD_OBJECTS (10000)
//   DELVIX_LOAD_CAMERAS (0: the built-in site; N: a generated site of N cameras at Loc1..LocN)
// scripts/load-test.sh runs it at full size and shows the report it prints.

#include "ServeClient.h"
#include "TestWait.h"

#include <QDateTime>
#include <QDir>
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

struct ClientStats
{
    QMap<QString, int> counts; // "command code" per request ("command" for stops), and "hits"
    QStringList faults;
    QList<std::pair<CaseEntry, int>> written; // acknowledged, with the vault: 0 old, 1 new, 2 either
};

qint64 now()
{
    return QDateTime::currentMSecsSinceEpoch();
}

QString compact(const QJsonObject& object)
{
    return QString::fromUtf8(QJsonDocument(object).toJson(QJsonDocument::Compact).left(200));
}

class LoadClient
{
public:
    LoadClient(int index, quint16 port, const std::atomic<int>* phase, ClientStats* stats)
        : m_index(index)
        , m_phase(phase)
        , m_stats(*stats)
        , m_http(port)
        , m_name(QStringLiteral("load-client-%1").arg(index))
        , m_location(QStringLiteral("Loc%1").arg(index + 1))
        , m_random(std::mt19937::result_type(1000 + index))
    {}

    void run(qint64 deadline)
    {
        // A first round of every kind, each client starting at another, so that even a short run
        // has all kinds in flight at once (the sanitizer runs count on that); then a random mix.
        for (int i = 0; now() < deadline; ++i) {
            send(i < 5 ? (m_index + i) % 5 : std::discrete_distribution<int>{30, 15, 15, 25, 15}(m_random));
        }
    }

private:
    int pickUpTo(int bound) { return std::uniform_int_distribution<int>(0, bound - 1)(m_random); }

    void send(int kind)
    {
        if (kind < 2 || (kind == 2 && m_feature.isEmpty())) {
            search("startSearch", kind == 1);
        } else if (kind == 2) {
            search("startReIdSearch", pickUpTo(3) == 0);
        } else {
            write(kind == 4);
        }
    }

    // Counts the request under its command and code; true when it ended cleanly with exactly one
    // final reply, as its last line (a stop with none), and that reply was a success.
    bool finished(const QString& command, const ServeAnswer& answer, bool stop = false)
    {
        const bool clean = answer.status == 200 && answer.error == QNetworkReply::NoError &&
                           answer.finalCount() == (stop ? 0 : 1) &&
                           (stop || answer.lines.last()["final"].toBool());
        ++m_stats.counts[stop ? command : command + ' ' + (clean ? answer.code() : "lost")];
        if (!clean) {
            m_stats.faults << QStringLiteral("%1 %2: did not end as it must (HTTP %3, error %4, %5 line(s))")
                                  .arg(m_name, command)
                                  .arg(answer.status)
                                  .arg(answer.error)
                                  .arg(answer.lines.size());
        }
        return clean && !stop && answer.code() == "0";
    }

    void search(const QString& command, bool stop)
    {
        const bool reId = command == "startReIdSearch";
        // Longer windows when stopped or re-identifying, so that a stop usually meets a running search.
        const qint64 length = stop || reId ? 3600 * 1000LL : 600 * 1000LL;
        const qint64 start =
            kSeedStartMs + std::uniform_int_distribution<qint64>(0, kSeedSpanMs - length)(m_random);
        QJsonObject params{{"startTimestamp", double(start)},
                           {"endTimestamp", double(start + length)},
                           {"locIDList", QJsonArray{m_location}}};
        if (reId) {
            params["feature"] = m_feature;
        } else if (pickUpTo(2) == 0) {
            params["humanInfo"] = QStringLiteral("{\"Gender\":%1}").arg(1 + pickUpTo(2));
        }
        // Stopped searches go under a second name: a stop's answer ends before the plug-in may have
        // handled it, and a late stop must not reach this client's next search.
        const QString name = stop ? m_name + "-stops" : m_name;
        const ServeAnswerPtr answer = m_http.request(command, params, name, kFirstReplyWait);
        if (stop) {
            const qint64 until = now() + 10 + pickUpTo(150); // let the search start
            waitFor([until]() { return now() >= until; });
            const QString stopCommand = reId ? "stopReIdSearch" : "stopSearch";
            finished(stopCommand, m_http.call(stopCommand, QJsonObject(), name, 0.2), true);
        }
        ServeConnection::wait(answer);
        if (!finished(command, *answer)) {
            return;
        }
        // Every hit from this client's own location, overlapping its window (the store keeps seconds).
        for (const QJsonObject& line : std::as_const(answer->lines).mid(0, answer->lines.size() - 1)) {
            const QJsonObject hit = line["payload"].toObject();
            const qint64 hitStart = hit["startTimestamp"].toInteger();
            ++m_stats.counts["hits"];
            if (hit["locID"] != m_location || hitStart > start + length + 999 ||
                hit["endTimestamp"].toInteger(hitStart) < start - 999) {
                m_stats.faults << QStringLiteral("%1 %2 at %3 from %4: foreign hit %5")
                                      .arg(m_name, command, m_location, QString::number(start), compact(hit));
            } else if (hit["feature"].toArray().size() == 512) {
                m_feature = hit["feature"].toArray();
            }
        }
    }

    // A new case with one item, or an item for one of this client's cases known to be in the
    // current vault (a case id means nothing in the other one).
    void write(bool toExistingCase)
    {
        const int before = m_phase->load();
        const qint64 start = kSeedStartMs + m_index * 1000000000LL + ++m_sequence * 1000LL;
        CaseEntry item{0,
                       QStringLiteral("%1 case %2").arg(m_name).arg(m_sequence),
                       "Cam" + QString::number(m_index + 1),
                       m_location,
                       start,
                       start + 60000,
                       pickUpTo(2),
                       pickUpTo(4) == 0};
        QJsonObject params{{"caseName", item.caseName}, {"reporter", m_name}, {"caseItem", item.itemJson()}};
        QList<CaseEntry> owners;
        for (const auto& [owner, vault] : std::as_const(m_cases)) {
            if (vault == before / 2 && before != 1) {
                owners << owner;
            }
        }
        if (toExistingCase && !owners.isEmpty()) {
            const CaseEntry& owner = owners.at(pickUpTo(int(owners.size())));
            item.caseId = owner.caseId;
            item.caseName = owner.caseName;
            params = item.itemJson();
            params["caseId"] = item.caseId;
        }
        const QString command = item.caseId ? "addCaseItem" : "addCaseWithItem";
        const ServeAnswer answer = m_http.call(command, params, m_name, kFirstReplyWait);
        const int after = m_phase->load();
        if (!finished(command, answer)) {
            return;
        }
        const int vault = before == 0 && after == 0 ? 0 : before == 2 ? 1 : 2;
        if (item.caseId == 0) {
            item.caseId = answer.payload()["caseId"].toInt();
            if (item.caseId <= 0 || answer.payload()["caseName"] != item.caseName) {
                m_stats.faults << m_name + " " + command + ": acknowledged with a wrong case";
                return;
            }
            m_cases << std::pair(item, vault);
        }
        if (vault == 2) {
            // Perhaps filed in the other vault, under whichever case has that id there.
            item.caseId = 0;
            item.caseName = command == "addCaseItem" ? QString() : item.caseName;
        }
        m_stats.written << std::pair(item, vault);
    }

    const int m_index;
    const std::atomic<int>* m_phase; // 0 first path, 1 moving, 2 second path
    ClientStats& m_stats;
    ServeConnection m_http;
    const QString m_name;
    const QString m_location;
    std::mt19937 m_random;
    QJsonArray m_feature;                     // from one of this client's own hits, for re-identification
    QList<std::pair<CaseEntry, int>> m_cases; // made by this client, with their vault
    int m_sequence = 0;
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

// The sampling the report shows: a field of the server's /proc status in MB.
double sampleMb(ServeProcess& serve, const char* field = "VmRSS")
{
    return double(serve.memoryKb(field)) / 1024.0;
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
    seed.start(DELVIX_HOST_PATH, {"seed", "--data", data.path(), "--objects", QString::number(objects),
                                  "--locations", QString::number(clients), "--seed", "7"});
    ASSERT_TRUE(seed.waitForFinished(scaledMs(1800000)));
    ASSERT_EQ(seed.exitCode(), 0) << seed.readAllStandardError().constData();
    const double seedSeconds = double(now() - seedStart) / 1000.0;

    // The synchroniser reads its settings from the working directory: a pass every 2 s.
    ASSERT_TRUE(writeFile(dir.filePath("routineSyncTimeBuffer.txt"), "2\n") &&
                writeFile(dir.filePath("getObjectDataTimeBuffer.txt"), "0\n"));
    QStringList siteLocations{"Loc1", "Loc2", "Loc3", "Loc4", "Loc5"}; // the built-in site's that record
    QStringList extra;
    if (cameras > 0) {
        // Distinct ports make distinct cameras; the host replaces them with free ones.
        QStringList list;
        siteLocations.clear();
        for (int i = 1; i <= cameras; ++i) {
            siteLocations << QStringLiteral("Loc%1").arg(i);
            list << QStringLiteral(R"({"name":"Cam%1","port":%2,"user":"admin","password":"cam-%1-pw",)"
                                   R"("location":"Loc%1","groupId":%3})")
                        .arg(i)
                        .arg(20000 + i)
                        .arg(1 + i % 4);
        }
        extra << "--site" << dir.filePath("site.json");
        ASSERT_TRUE(writeFile(extra.last(), "{\"cameras\":[" + list.join(',').toUtf8() + "]}"));
    }

    ServeProcess serve;
    ASSERT_TRUE(serve.start(data.path(), extra));
    const qint64 serveStart = now();
    std::atomic<int> phase{0};
    std::vector<ClientStats> stats(static_cast<size_t>(clients));
    double settledMb = 0;
    {
        ClientThreads threads(clients, [&](int i) {
            LoadClient(i, serve.port(), &phase, &stats[size_t(i)]).run(serveStart + seconds * 1000LL);
        });
        // A quarter in, the memory the server settled at; half-way, the database path moves.
        waitFor([&]() { return now() >= serveStart + seconds * 250; }, seconds * 1000);
        settledMb = sampleMb(serve);
        waitFor([&]() { return now() >= serveStart + seconds * 500; }, seconds * 1000);
        phase = 1;
        const ServeAnswerPtr move = serve.http().post(
            "/host/databasePath", QJsonDocument(QJsonObject{{"path", dir.filePath("database2")}}).toJson());
        ServeConnection::wait(move);
        EXPECT_EQ(move->status, 200);
        phase = 2;
    }
    const double loadSeconds = double(now() - serveStart) / 1000.0;
    ClientStats total;
    for (const ClientStats& s : stats) {
        for (auto it = s.counts.cbegin(); it != s.counts.cend(); ++it) {
            total.counts[it.key()] += it.value();
        }
        total.faults += s.faults;
        total.written += s.written;
    }

    // The synchroniser ran meanwhile: what the site's cameras recorded in this run is in the store.
    const QJsonObject recent{{"startTimestamp", double(serveStart - 3600 * 1000LL)},
                             {"endTimestamp", double(now())},
                             {"locIDList", QJsonArray::fromStringList(siteLocations)}};
    const qsizetype synchronised =
        serve.http().call("startSearch", recent, "sync", kFirstReplyWait).lines.size() - 1;
    EXPECT_GT(synchronised, 0) << "nothing the cameras recorded during the run was found";
    const double endMb = sampleMb(serve), peakMb = sampleMb(serve, "VmHWM");
    ASSERT_TRUE(serve.stop()) << "the server did not stop cleanly on SIGTERM";

    // Every acknowledged case and item in the vault it belongs to, as sent.
    QHash<qint64, CaseEntry> vaults[2];
    for (const int second : {0, 1}) {
        QString error;
        const QString file = dir.filePath(second ? "database2" : "database") + "/PluginDelvix/CaseVault.db";
        EXPECT_TRUE(readVault(file, &vaults[second], &error))
            << qPrintable(file) << ": " << qPrintable(error);
    }
    for (const auto& [sent, vault] : std::as_const(total.written)) {
        if (!(vault != 1 && sent.sameItem(vaults[0].value(sent.start))) &&
            !(vault != 0 && sent.sameItem(vaults[1].value(sent.start)))) {
            total.faults << QStringLiteral("%1 (case %2, starting %3) is not in vault %4 as sent")
                                .arg(sent.nodeId)
                                .arg(sent.caseId)
                                .arg(sent.start)
                                .arg(vault);
        }
    }

    int sent = 0;
    QStringList mix;
    for (auto it = total.counts.cbegin(); it != total.counts.cend(); ++it) {
        sent += it.key() == "hits" ? 0 : it.value();
        mix << QStringLiteral("%1 %2").arg(it.key()).arg(it.value());
    }
    std::printf(
        "\nLoad test report\n"
        "  size: %d clients, %d s, %d seeded objects (seeded in %.1f s), %d cameras (0: built-in site)\n"
        "  requests: %d sent, %d served (server's count), %.1f requests/s over %.1f s\n"
        "  mix (\"command code\" answered; stops send no reply): %s\n"
        "  vaults: %d acknowledged cases and items checked, entries %d + %d\n"
        "  synchroniser: %d objects of this run found at the site's locations\n"
        "  server memory: peak RSS %.1f MB, a quarter in %.1f MB, at the end %.1f MB\n",
        clients, seconds, objects, seedSeconds, cameras, sent, serve.requestsServed(), sent / loadSeconds,
        loadSeconds, qPrintable(mix.join(", ")), int(total.written.size()), int(vaults[0].size()),
        int(vaults[1].size()), int(synchronised), peakMb, settledMb, endMb);
    for (const QString& fault : std::as_const(total.faults).mid(0, 20)) {
        std::printf("  FAULT: %s\n", qPrintable(fault));
    }
    std::fflush(stdout);

    EXPECT_TRUE(total.faults.isEmpty())
        << total.faults.size() << " fault(s), the first: " << qPrintable(total.faults.value(0));
    EXPECT_GE(serve.requestsServed(), sent);
    // Every kind of request was in the mix and found or stored something.
    for (const char* kind :
         {"hits", "startSearch 0", "stopSearch", "startReIdSearch 0", "addCaseWithItem 0", "addCaseItem 0"}) {
        EXPECT_GT(total.counts.value(kind), 0) << kind;
    }
    // Flat memory with room for caches and allocator slack; instrumented builds keep shadow memory
    // and quarantined blocks, so there it is only reported.
    if (kTimeScale == 1) {
        EXPECT_LT(endMb, std::max(settledMb * 2, settledMb + 256));
    }
    if (::testing::Test::HasFailure()) {
        data.setAutoRemove(false); // both vaults, for a look
        std::printf("  data folder kept: %s\n", qPrintable(data.path()));
    }
}
