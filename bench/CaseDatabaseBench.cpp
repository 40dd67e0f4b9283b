// What the case vault's open-per-operation design costs: three operations on a vault of 10,000
// cases and 200,000 items, each beside the same statements on a connection kept open.
// Medians come from the repetitions (`--benchmark_repetitions` overrides the default of 9).

#include "CaseDatabase.h"
#include "DelvixKeys.h"

#include <QCoreApplication>
#include <QSqlDatabase>
#include <QSqlQuery>
#include <QTemporaryDir>
#include <benchmark/benchmark.h>
#include <malloc.h>
#include <memory>

namespace {

constexpr int caseCount = 10000;
constexpr int itemCount = 200000;
constexpr int listedCase = 1; // holds exactly 50 items; the others share the rest

QString g_databasePath;

QVariantMap benchItem(qint64 start)
{
    return {{KEY_START_TIMESTAMP, start},
            {KEY_END_TIMESTAMP, start + 5000},
            {KEY_CASE_ITEM_TYPE, int(start % 2)},
            {KEY_NODE_ID, QStringLiteral("relay/cam%1").arg(start % 64)},
            {KEY_LOC_ID, QStringLiteral("Loc%1").arg(start % 64)},
            {KEY_OBJ_IMAGE, QStringLiteral("object-image-%1").arg(start)},
            {KEY_FACE_IMAGE, start % 3 == 0 ? QStringLiteral("face-image-%1").arg(start) : QString()},
            {KEY_TRAJECTORY,
             QVariantList{QVariantMap{{"x", 0.1}, {"y", 0.2}}, QVariantMap{{"x", 0.3}, {"y", 0.4}}}},
            {KEY_BOOKMARK_ID, QString::number(start)}};
}

// Fills the vault in one transaction through a connection of its own: seeding through the vault
// itself would take an opening and a synchronous commit per row.
bool seedVault(const QString& path)
{
    CaseDatabase{path}; // folder, file and tables
    const QString name = QStringLiteral("seed");
    bool ok = false;
    {
        QSqlDatabase db = QSqlDatabase::addDatabase(QStringLiteral("QSQLITE"), name);
        db.setDatabaseName(path + QStringLiteral("/PluginDelvix/CaseVault.db"));
        if (db.open() && db.transaction()) {
            QSqlQuery cases(db);
            cases.prepare(QStringLiteral("INSERT INTO \"Case\" (name, number, reporter, description, "
                                         "createdTime) VALUES (?, ?, ?, ?, ?)"));
            for (int i = 1; i <= caseCount; ++i) {
                cases.addBindValue(QStringLiteral("case %1").arg(i));
                cases.addBindValue(QString::number(10000000 + i));
                cases.addBindValue(QStringLiteral("reporter"));
                cases.addBindValue(QStringLiteral("description of case %1").arg(i));
                cases.addBindValue(1600000000 + i);
                cases.exec();
            }
            QSqlQuery items(db);
            items.prepare(
                QStringLiteral("INSERT INTO CaseItem (caseId, startTime, endTime, itemType, nodeId, "
                               "locationId, objectImage, trajectory, faceImage, bookmarkId) VALUES (?, ?, "
                               "?, ?, ?, ?, ?, ?, ?, ?)"));
            for (int i = 0; i < itemCount; ++i) {
                const int caseId = i < 50 ? listedCase : 2 + (i % (caseCount - 1));
                const QVariantMap item = benchItem(1600000000000 + i);
                items.addBindValue(caseId);
                items.addBindValue(item.value(KEY_START_TIMESTAMP));
                items.addBindValue(item.value(KEY_END_TIMESTAMP));
                items.addBindValue(item.value(KEY_CASE_ITEM_TYPE));
                items.addBindValue(item.value(KEY_NODE_ID));
                items.addBindValue(item.value(KEY_LOC_ID));
                items.addBindValue(item.value(KEY_OBJ_IMAGE));
                items.addBindValue(QByteArray(R"([{"x":0.1,"y":0.2},{"x":0.3,"y":0.4}])"));
                items.addBindValue(item.value(KEY_FACE_IMAGE));
                items.addBindValue(item.value(KEY_BOOKMARK_ID));
                items.exec();
            }
            ok = db.commit();
        }
    }
    QSqlDatabase::removeDatabase(name);
    return ok;
}

// A connection that stays open for the whole benchmark, with foreign keys on as in the vault.
class KeptOpen
{
public:
    KeptOpen()
    {
        QSqlDatabase db = QSqlDatabase::addDatabase(QStringLiteral("QSQLITE"), m_name);
        db.setDatabaseName(g_databasePath + QStringLiteral("/PluginDelvix/CaseVault.db"));
        db.open();
        QSqlQuery(db).exec(QStringLiteral(" PRAGMA foreign_keys = ON; "));
    }
    ~KeptOpen() { QSqlDatabase::removeDatabase(m_name); }
    QSqlDatabase db() const { return QSqlDatabase::database(m_name, false); }

private:
    const QString m_name = QStringLiteral("keptOpen");
};

void runSelect(QSqlQuery& query, int boundTimes, int caseId)
{
    for (int i = 0; i < boundTimes; ++i) {
        query.bindValue(i, caseId);
    }
    query.exec();
    while (query.next()) {
        benchmark::DoNotOptimize(query.value(0));
    }
}

void BM_AddCaseItem_Vault(benchmark::State& state)
{
    CaseDatabase vault(g_databasePath);
    qint64 start = 1700000000000;
    for (auto _ : state) {
        benchmark::DoNotOptimize(vault.addCaseItem(listedCase + 1, benchItem(++start)));
    }
}

void BM_AddCaseItem_KeptOpen(benchmark::State& state)
{
    KeptOpen connection;
    QSqlQuery query(connection.db());
    query.prepare(QStringLiteral("INSERT INTO CaseItem (caseId, startTime, endTime, itemType, nodeId, "
                                 "locationId, objectImage, trajectory, "
                                 "faceImage, previewImage, showFacePhotoOnReport, showObjectPhotoOnReport, "
                                 "bookmarkId, needBookmark) VALUES "
                                 "(?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?)"));
    qint64 start = 1800000000000;
    for (auto _ : state) {
        const QVariantMap item = benchItem(++start);
        const QVariantList values{listedCase + 1,
                                  item.value(KEY_START_TIMESTAMP),
                                  item.value(KEY_END_TIMESTAMP),
                                  item.value(KEY_CASE_ITEM_TYPE),
                                  item.value(KEY_NODE_ID),
                                  item.value(KEY_LOC_ID),
                                  item.value(KEY_OBJ_IMAGE),
                                  QByteArray(R"([{"x":0.1,"y":0.2},{"x":0.3,"y":0.4}])"),
                                  item.value(KEY_FACE_IMAGE),
                                  QString(),
                                  1,
                                  1,
                                  item.value(KEY_BOOKMARK_ID),
                                  false};
        for (int i = 0; i < values.size(); ++i) {
            query.bindValue(i, values.at(i));
        }
        benchmark::DoNotOptimize(query.exec());
    }
}

void BM_GetCaseItemList_Vault(benchmark::State& state)
{
    CaseDatabase vault(g_databasePath);
    for (auto _ : state) {
        benchmark::DoNotOptimize(vault.getCaseItemList(listedCase));
    }
}

void BM_GetCaseItemList_KeptOpen(benchmark::State& state)
{
    KeptOpen connection;
    QSqlQuery query(connection.db());
    query.prepare(QStringLiteral(
        "SELECT id, startTime, endTime, nodeId, locationId, objectImage, trajectory, faceImage, "
        "previewImage, "
        "showFacePhotoOnReport, showObjectPhotoOnReport, comment, emapImageScale, emapAngle, bookmarkId, "
        "needBookmark, itemType FROM CaseItem WHERE caseId = ?"));
    for (auto _ : state) {
        runSelect(query, 1, listedCase);
    }
}

void BM_GetCaseInfoMap_Vault(benchmark::State& state)
{
    CaseDatabase vault(g_databasePath);
    for (auto _ : state) {
        benchmark::DoNotOptimize(vault.getCaseInfoMap(listedCase));
    }
}

void BM_GetCaseInfoMap_KeptOpen(benchmark::State& state)
{
    KeptOpen connection;
    QSqlQuery cover(connection.db());
    cover.prepare(QStringLiteral(
        "SELECT image, itemType, startTime FROM (SELECT faceImage AS image, itemType, startTime FROM "
        "CaseItem WHERE "
        "caseId = ? AND faceImage IS NOT NULL AND faceImage != '' AND itemType = 0 UNION ALL SELECT "
        "objectImage AS "
        "image, itemType, startTime FROM CaseItem WHERE caseId = ? AND objectImage IS NOT NULL AND "
        "objectImage != '' "
        "AND (faceImage IS NULL OR faceImage == '') AND itemType = 0 UNION ALL SELECT objectImage AS image, "
        "itemType, startTime FROM CaseItem WHERE caseId = ? AND objectImage IS NOT NULL AND objectImage != "
        "'' AND "
        "itemType = 1) ORDER BY startTime"));
    QSqlQuery duration(connection.db());
    duration.prepare(QStringLiteral("SELECT MIN(startTime), MAX(endTime) FROM CaseItem WHERE caseId = ?"));
    for (auto _ : state) {
        runSelect(cover, 3, listedCase);
        runSelect(duration, 1, listedCase);
    }
}

// What the vault keeps in memory for each case (its case map, loaded at construction): the heap in
// use after a vault of caseCount cases is made, against before, per case.
void BM_CaseMapBytesPerCase(benchmark::State& state)
{
    for (auto _ : state) {
        const size_t before = mallinfo2().uordblks;
        CaseDatabase vault(g_databasePath);
        const size_t after = mallinfo2().uordblks;
        benchmark::DoNotOptimize(vault.containCase(listedCase));
        state.counters["bytes_per_case"] = double(after - before) / caseCount;
    }
}

} // namespace

BENCHMARK(BM_CaseMapBytesPerCase)->Iterations(1);
BENCHMARK(BM_AddCaseItem_Vault)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_AddCaseItem_KeptOpen)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_GetCaseItemList_Vault)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_GetCaseItemList_KeptOpen)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_GetCaseInfoMap_Vault)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_GetCaseInfoMap_KeptOpen)->Unit(benchmark::kMicrosecond);

int main(int argc, char** argv)
{
    QCoreApplication app(argc, argv); // the SQL driver is a plug-in, found through the application
    QTemporaryDir dir;
    g_databasePath = dir.path();
    if (!dir.isValid() || !seedVault(g_databasePath)) {
        return 1;
    }
    std::vector<char*> args(argv, argv + argc);
    std::string repetitions = "--benchmark_repetitions=9";
    std::string aggregates = "--benchmark_report_aggregates_only=true";
    args.insert(args.begin() + 1, {repetitions.data(), aggregates.data()});
    int count = int(args.size());
    benchmark::Initialize(&count, args.data());
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
