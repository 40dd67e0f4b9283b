// The case vault on real SQLite files: creation and reopening, each write and its effect on the
// case map, the read models, the faults it must survive (no path, statements refused behind its
// back, callers on several threads, copies), and durability across a killed process.

#include "CaseDatabase.h"
#include "CaseVaultDump.h"
#include "DelvixKeys.h"
#include "FakeWemlo.h"
#include "LogFacility.h"

#include <QDataStream>
#include <QDateTime>
#include <QDir>
#include <QFileInfo>
#include <QProcess>
#include <QSqlDatabase>
#include <QSqlQuery>
#include <QSqlRecord>
#include <QTemporaryDir>
#include <QUuid>
#include <gtest/gtest.h>
#include <memory>
#include <thread>
#include <vector>

namespace {

// Runs one statement on a connection of the test's own, behind the vault's back, and returns
// the first row (empty when there is none or the statement failed).
QVariantList rawRow(const QString& file, const QString& statement, const QVariantList& values = {})
{
    const QString name = QUuid::createUuid().toString();
    QVariantList row;
    {
        QSqlDatabase db = QSqlDatabase::addDatabase(QStringLiteral("QSQLITE"), name);
        db.setDatabaseName(file);
        QSqlQuery query(db);
        if (db.open() && query.prepare(statement)) {
            for (const QVariant& value : values) {
                query.addBindValue(value);
            }
            if (query.exec() && query.next()) {
                for (int i = 0; i < query.record().count(); ++i) {
                    row.append(query.value(i));
                }
            }
        }
    }
    QSqlDatabase::removeDatabase(name);
    return row;
}

QVariantMap item(int type, qint64 start, const QString& face = {}, const QString& object = {})
{
    return {{KEY_CASE_ITEM_TYPE, type},
            {KEY_START_TIMESTAMP, start},
            {KEY_END_TIMESTAMP, start + 1000},
            {KEY_FACE_IMAGE, face},
            {KEY_OBJ_IMAGE, object},
            {KEY_NODE_ID, QStringLiteral("cam1")},
            {KEY_LOC_ID, QStringLiteral("Loc1")}};
}

QSet<QString> keysOf(const QVariantMap& map)
{
    const QStringList keys = map.keys();
    return QSet<QString>(keys.begin(), keys.end());
}

// Same shape, same value types and equal values, all the way down.
bool sameTree(const QVariant& a, const QVariant& b)
{
    if (a.metaType() != b.metaType()) {
        return false;
    }
    if (a.metaType() == QMetaType::fromType<QVariantMap>()) {
        const QVariantMap left = a.toMap(), right = b.toMap();
        return left.keys() == right.keys() &&
               std::all_of(left.keyBegin(), left.keyEnd(),
                           [&](const QString& key) { return sameTree(left.value(key), right.value(key)); });
    }
    if (a.metaType() == QMetaType::fromType<QVariantList>()) {
        const QVariantList left = a.toList(), right = b.toList();
        if (left.size() != right.size()) {
            return false;
        }
        for (int i = 0; i < left.size(); ++i) {
            if (!sameTree(left.at(i), right.at(i))) {
                return false;
            }
        }
        return true;
    }
    return a == b;
}

class CaseDatabaseTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        ASSERT_TRUE(m_dir.isValid());
        fakeWemloReset();
        LogFacility::reload(FAKE_WEMLO_PATH);
    }
    void TearDown() override { fakeWemloReset(); }

    QString vaultFile() const { return m_dir.path() + QStringLiteral("/PluginDelvix/CaseVault.db"); }
    QVariantList raw(const QString& statement, const QVariantList& values = {}) const
    {
        return rawRow(vaultFile(), statement, values);
    }
    int rawCount(const QString& table, int caseId) const
    {
        return raw(QStringLiteral("SELECT COUNT(*) FROM %1 WHERE %2 = ?")
                       .arg(table, table == QLatin1String("CaseItem") ? "caseId" : "id"),
                   {caseId})
            .value(0)
            .toInt();
    }
    static bool logged(const char* part)
    {
        for (const FakeWemloLine& line : fakeWemloState().lines) {
            if (line.text.find(part) != std::string::npos) {
                return true;
            }
        }
        return false;
    }
    static int loggedErrors()
    {
        int errors = 0;
        for (const FakeWemloLine& line : fakeWemloState().lines) {
            errors += (line.selector & 0xff) == LogFacility::LevelError ? 1 : 0;
        }
        return errors;
    }

    QTemporaryDir m_dir;
};

TEST_F(CaseDatabaseTest, CreatesFolderFileAndBothTablesThenReopensThemAsTheyAre)
{
    ASSERT_FALSE(QFileInfo::exists(m_dir.path() + "/PluginDelvix"));
    {
        CaseDatabase vault(m_dir.path());
        EXPECT_TRUE(vault.getAllCase().isEmpty());
        const int caseId = vault.addCase("Burglary", "10000001", "Ann");
        EXPECT_GT(vault.addCaseItem(caseId, item(0, 5000, "face")), 0);
    }
    EXPECT_TRUE(QFileInfo::exists(vaultFile()));
    EXPECT_EQ(raw("SELECT COUNT(*) FROM sqlite_master WHERE type = 'table' AND name IN ('Case', 'CaseItem')"),
              QVariantList{2});
    EXPECT_EQ(loggedErrors(), 0);

    // Reopening keeps the tables and their rows and loads the case.
    CaseDatabase reopened(m_dir.path());
    ASSERT_EQ(reopened.getAllCase().size(), 1);
    EXPECT_EQ(reopened.getCaseItemList(1).size(), 1);
    EXPECT_EQ(loggedErrors(), 0);
}

TEST_F(CaseDatabaseTest, FileWithOnlyTheCaseTableGetsItsItemTableAndKeepsItsCases)
{
    QDir(m_dir.path()).mkdir("PluginDelvix");
    raw(SQL_CREATE_CASE_TABLE);
    raw("INSERT INTO \"Case\" (name, number, reporter, createdTime) VALUES ('Old', '1', 'Bo', 100)");
    raw("INSERT INTO \"Case\" (name, number, reporter, description, createdTime) VALUES ('New', '2', 'Cy', "
        "'d', "
        "300)");

    CaseDatabase vault(m_dir.path());
    const QVariantList cases = vault.getAllCase();
    ASSERT_EQ(cases.size(), 2);
    const QVariantMap first = cases.at(0).toMap();
    EXPECT_EQ(keysOf(first),
              (QSet<QString>{"caseId", "caseName", "caseNumber", "reporter", "description", "createdTime"}));
    EXPECT_EQ(first.value("caseId").metaType(), QMetaType::fromType<int>());
    EXPECT_EQ(first.value("caseName"), "Old");
    EXPECT_EQ(first.value("description").metaType(), QMetaType::fromType<QString>());
    EXPECT_EQ(first.value("createdTime").metaType(), QMetaType::fromType<qlonglong>());
    EXPECT_EQ(cases.at(1).toMap().value("description"), "d");
    EXPECT_GT(vault.addCaseItem(2, item(0, 1)), 0);
    // Item reads by case use an index, added to files made without it.
    EXPECT_EQ(raw("SELECT COUNT(*) FROM sqlite_master WHERE type = 'index' AND tbl_name = 'CaseItem'"),
              QVariantList{1});
}

TEST_F(CaseDatabaseTest, TwoInstancesOnOnePathUseTheirOwnConnectionsSideBySide)
{
    const qsizetype connectionsBefore = QSqlDatabase::connectionNames().size();
    {
        CaseDatabase first(m_dir.path());
        CaseDatabase second(m_dir.path());
        EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore + 2);
        const int a = first.addCase("A", "1", "r");
        const int b = second.addCase("B", "2", "r");
        EXPECT_GT(a, 0);
        EXPECT_GT(b, a);
        // Each instance sees the file, but its case map only holds what it loaded or wrote.
        EXPECT_FALSE(first.containCase(b));
        EXPECT_GT(first.addCaseItem(b, item(0, 1)), 0);
        EXPECT_EQ(CaseDatabase(m_dir.path()).getAllCase().size(), 2);
    }
    EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore);
}

TEST_F(CaseDatabaseTest, CaseWritesKeepFileAndCaseMapInStep)
{
    CaseDatabase vault(m_dir.path());
    const qint64 before = QDateTime::currentSecsSinceEpoch();
    const int caseId = vault.addCase("Theft", "12345678", "Ann");
    ASSERT_GT(caseId, 0);
    const QVariantList stored =
        raw("SELECT createdTime, description IS NULL FROM \"Case\" WHERE id = ?", {caseId});
    EXPECT_GE(stored.value(0).toLongLong(), before);
    EXPECT_LE(stored.value(0).toLongLong(), QDateTime::currentSecsSinceEpoch());
    EXPECT_EQ(stored.value(1).toInt(), 1);
    QVariantMap cached = vault.getAllCase().value(0).toMap();
    EXPECT_EQ(cached.value("createdTime"), stored.value(0).toLongLong());
    EXPECT_EQ(cached.value("description"), QString());
    EXPECT_TRUE(vault.containCase(caseId));

    // Update writes all four fields; a missing one becomes empty text, in the file and the map.
    EXPECT_TRUE(vault.updateCase(caseId, {{"caseName", "Theft 2"}, {"caseNumber", 42}, {"reporter", "Bo"}}));
    EXPECT_EQ(raw("SELECT name, number, reporter, description FROM \"Case\" WHERE id = ?", {caseId}),
              (QVariantList{"Theft 2", "42", "Bo", ""}));
    cached = vault.getAllCase().value(0).toMap();
    EXPECT_EQ(cached.value("caseNumber"), "42");
    EXPECT_EQ(cached.value("description").metaType(), QMetaType::fromType<QString>());
    EXPECT_EQ(cached.value("caseId"), caseId);
    EXPECT_EQ(cached.value("createdTime"), stored.value(0).toLongLong());

    // An update of a case the file does not hold claims nothing and adds nothing to the map.
    EXPECT_FALSE(vault.updateCase(caseId + 100, {{"caseName", "ghost"}}));
    EXPECT_FALSE(vault.containCase(caseId + 100));

    // A case written by another program is not seen until a new instance loads the file.
    raw("INSERT INTO \"Case\" (name, createdTime) VALUES ('Other', 1)");
    EXPECT_FALSE(vault.containCase(caseId + 1));
    EXPECT_TRUE(CaseDatabase(m_dir.path()).containCase(caseId + 1));

    // Deleting takes the items along, leaves other cases' items alone, and is true for no row.
    const int other = vault.addCase("Other", "2", "r");
    vault.addCaseItem(caseId, item(0, 1));
    vault.addCaseItem(caseId, item(1, 2));
    vault.addCaseItem(other, item(0, 3));
    EXPECT_TRUE(vault.deleteCase(caseId));
    EXPECT_EQ(rawCount("CaseItem", caseId), 0);
    EXPECT_EQ(rawCount("CaseItem", other), 1);
    EXPECT_EQ(rawCount("\"Case\"", caseId), 0);
    EXPECT_FALSE(vault.containCase(caseId));
    EXPECT_TRUE(vault.getCaseInfoMap(caseId).isEmpty());
    EXPECT_TRUE(vault.deleteCase(9999));
    EXPECT_EQ(loggedErrors(), 1); // only the update of the missing case
}

TEST_F(CaseDatabaseTest, ItemWritesStoreWhatTheItemMapSays)
{
    CaseDatabase vault(m_dir.path());
    const int caseId = vault.addCase("c", "1", "r");

    QVariantMap full = item(1, 1000, "face.jpg");
    full.insert(KEY_TRAJECTORY, QVariantList{QVariantMap{{"x", 0.5}, {"y", 0.25}}});
    full.insert(KEY_BOOKMARK_ID, "77");
    full.insert(KEY_NEED_BOOKMARK, true);
    full.insert(KEY_PREVIEW_IMAGE, "preview");
    const int fullId = vault.addCaseItem(caseId, full);
    ASSERT_GT(fullId, 0);
    EXPECT_EQ(raw("SELECT showFacePhotoOnReport, showObjectPhotoOnReport, CAST(trajectory AS TEXT), comment, "
                  "emapImageScale, "
                  "emapAngle, bookmarkId, needBookmark, itemType FROM CaseItem WHERE id = ?",
                  {fullId}),
              (QVariantList{1, 0, R"([{"x":0.5,"y":0.25}])", "", -1.0, 0.0, 77, 1, 1}));

    const int bareId = vault.addCaseItem(caseId, {{KEY_OBJ_IMAGE, "obj"}});
    EXPECT_EQ(raw("SELECT showFacePhotoOnReport, showObjectPhotoOnReport, CAST(trajectory AS TEXT) FROM "
                  "CaseItem WHERE id = ?",
                  {bareId}),
              (QVariantList{0, 1, "[]"}));

    // Items need a stored case: the foreign key refuses the rest.
    EXPECT_EQ(vault.addCaseItem(caseId + 1, item(0, 1)), 0);
    EXPECT_EQ(rawCount("CaseItem", caseId + 1), 0);
    EXPECT_TRUE(logged("execute failed"));

    EXPECT_TRUE(vault.updateCaseItem(fullId, {{"showFacePhotoOnReport", false},
                                              {"showObjectPhotoOnReport", 1},
                                              {"comment", "seen"},
                                              {"emapImageScale", 2.5},
                                              {"emapAngle", 90}}));
    const QVariantMap updated = vault.getCaseItemInfoMap(fullId);
    EXPECT_EQ(updated.value("showFacePhotoOnReport"), false);
    EXPECT_EQ(updated.value("showObjectPhotoOnReport"), true);
    EXPECT_EQ(updated.value("comment"), "seen");
    EXPECT_EQ(updated.value("emapImageScale"), 2.5);
    EXPECT_EQ(updated.value("emapAngle"), 90.0);
    EXPECT_TRUE(vault.updateCaseItem(bareId, {}));
    EXPECT_EQ(raw("SELECT emapImageScale FROM CaseItem WHERE id = ?", {bareId}), QVariantList{0.0});
    EXPECT_FALSE(vault.updateCaseItem(9999, {{"comment", "x"}}));

    EXPECT_TRUE(vault.deleteCaseItem(bareId));
    EXPECT_TRUE(vault.getCaseItemInfoMap(bareId).isEmpty());
    EXPECT_TRUE(vault.deleteCaseItem(9999));
    EXPECT_EQ(vault.getCaseItemIdSet(caseId), QSet<int>{fullId});
}

TEST_F(CaseDatabaseTest, ReadModelsHaveTheirKeysTypesAndOrder)
{
    QDir(m_dir.path()).mkdir("PluginDelvix");
    raw(SQL_CREATE_CASE_TABLE);
    for (int createdTime : {100, 300, 200}) {
        raw("INSERT INTO \"Case\" (name, createdTime) VALUES (?, ?)",
            {QString::number(createdTime), createdTime});
    }
    CaseDatabase vault(m_dir.path());

    const QVariantList list = vault.getCaseList();
    ASSERT_EQ(list.size(), 3);
    QList<uint> order;
    for (const QVariant& summary : list) {
        EXPECT_EQ(keysOf(summary.toMap()), (QSet<QString>{"caseId", "caseName", "createdTime"}));
        EXPECT_EQ(summary.toMap().value("createdTime").metaType(), QMetaType::fromType<uint>());
        order.append(summary.toMap().value("createdTime").toUInt());
    }
    EXPECT_EQ(order, (QList<uint>{300, 200, 100}));
    EXPECT_EQ(vault.getAllCase().value(1).toMap().value("caseId"), 2); // ascending ids, unsorted

    // A case without items.
    const QVariantMap empty = vault.getCaseInfoMap(1);
    EXPECT_EQ(empty.size(), 9);
    EXPECT_EQ(empty.value("coverImage").toStringList(), QStringList());
    EXPECT_EQ(empty.value("startTimestamp"), "0");
    EXPECT_EQ(empty.value("endTimestamp"), "0");
    EXPECT_TRUE(vault.getCaseInfoMap(99).isEmpty());

    // Durations are local minutes; a start of 0 is no start.
    const qint64 start = QDateTime(QDate(2024, 3, 5), QTime(14, 7, 30)).toMSecsSinceEpoch();
    const qint64 end = QDateTime(QDate(2024, 3, 6), QTime(9, 15, 59)).toMSecsSinceEpoch() - 1000;
    vault.addCaseItem(2, item(0, start + 60000));
    vault.addCaseItem(2, item(0, start));
    vault.addCaseItem(2, item(0, end));
    EXPECT_EQ(vault.getCaseDuration(2),
              std::make_pair(QString("2024-03-05 14:07"), QString("2024-03-06 09:15")));
    vault.addCaseItem(3, item(0, 0));
    vault.addCaseItem(3, item(0, end));
    EXPECT_EQ(vault.getCaseDuration(3).first, "0");
    EXPECT_EQ(vault.getCaseInfoMap(3).value("endTimestamp"), "2024-03-06 09:15");

    // Item records.
    const QVariantList items = vault.getCaseItemList(2);
    ASSERT_EQ(items.size(), 3);
    const QVariantMap record = items.at(1).toMap();
    const QSet<QString> infoKeys{"id",
                                 "startTimestamp",
                                 "endTimestamp",
                                 "nodeID",
                                 "locID",
                                 "objImage",
                                 "trajectory",
                                 "faceImage",
                                 "previewImage",
                                 "showFacePhotoOnReport",
                                 "showObjectPhotoOnReport",
                                 "comment",
                                 "emapImageScale",
                                 "emapAngle",
                                 "bookmarkId"};
    EXPECT_EQ(keysOf(record), (infoKeys + QSet<QString>{"needBookmark", "objType"}));
    const std::vector<std::pair<const char*, QMetaType>> types{
        {"id", QMetaType::fromType<int>()},
        {"startTimestamp", QMetaType::fromType<qlonglong>()},
        {"nodeID", QMetaType::fromType<QString>()},
        {"trajectory", QMetaType::fromType<QVariantList>()},
        {"showFacePhotoOnReport", QMetaType::fromType<bool>()},
        {"emapImageScale", QMetaType::fromType<double>()},
        {"bookmarkId", QMetaType::fromType<QString>()},
        {"needBookmark", QMetaType::fromType<bool>()},
        {"objType", QMetaType::fromType<int>()}};
    for (const auto& [key, type] : types) {
        EXPECT_EQ(record.value(key).metaType(), type) << key;
    }
    EXPECT_EQ(record.value("startTimestamp"), start);
    EXPECT_EQ(record.value("trajectory").toList(), QVariantList());
    QVariantMap single = vault.getCaseItemInfoMap(record.value("id").toInt());
    EXPECT_EQ(keysOf(single), infoKeys);
    single.insert("needBookmark", false);
    single.insert("objType", 0);
    EXPECT_TRUE(sameTree(single, record));

    // Text that is not JSON reads as no trajectory.
    raw("UPDATE CaseItem SET trajectory = 'not json'");
    EXPECT_EQ(vault.getCaseItemList(2).value(0).toMap().value("trajectory"), QVariantList());
}

TEST_F(CaseDatabaseTest, CoverImagesFillThreeSlotsInStartTimeOrder)
{
    CaseDatabase vault(m_dir.path());
    struct Row
    {
        int type;
        const char* face;
        const char* object;
    };
    // Rows are written in reverse start-time order so the statement's own order shows.
    const auto cover = [&](const std::vector<Row>& rows) {
        const int caseId = vault.addCase("c", "1", "r");
        for (int i = int(rows.size()) - 1; i >= 0; --i) {
            vault.addCaseItem(caseId, item(rows[i].type, 1000 * (i + 1), rows[i].face, rows[i].object));
        }
        return vault.getCaseCoverImage(caseId);
    };
    EXPECT_EQ(cover({{1, "", "rec"}, {0, "", "a"}, {0, "", "b"}}), (QStringList{"rec", "a"}));
    EXPECT_EQ(cover({{0, "", "a"}, {0, "", "b"}, {1, "", "rec"}, {0, "", "d"}}),
              (QStringList{"a", "b", "d"}));
    EXPECT_EQ(cover({{0, "", "a"}, {1, "", "rec"}, {1, "", "rec2"}}), (QStringList{"a", "rec"}));
    EXPECT_EQ(cover({{0, "face", "body"}, {0, "", ""}, {1, "", ""}, {0, "", "b"}}),
              (QStringList{"face", "b"}));
    EXPECT_EQ(cover({{0, "a", ""}, {0, "b", ""}, {0, "c", ""}, {0, "d", ""}}), (QStringList{"a", "b", "c"}));

    const int caseId = vault.addCase("c", "1", "r");
    vault.addCaseItem(caseId, item(0, 1, "f1"));
    EXPECT_EQ(vault.getCaseInfoMap(caseId).value("coverImage").toStringList(), QStringList{"f1"});
}

TEST_F(CaseDatabaseTest, EmptyPathMakesNoFileAndFailsEveryOperationVisibly)
{
    const bool rootFolderBefore = QFileInfo::exists("/PluginDelvix");
    const QString previousCurrent = QDir::currentPath();
    QDir::setCurrent(m_dir.path());
    for (CaseDatabase* vault : {new CaseDatabase(QString()), new CaseDatabase()}) {
        std::unique_ptr<CaseDatabase> owner(vault);
        EXPECT_EQ(vault->addCase("c", "1", "r"), 0);
        EXPECT_EQ(vault->addCaseItem(1, item(0, 1)), 0);
        EXPECT_FALSE(vault->updateCase(1, {{"caseName", "x"}}));
        EXPECT_FALSE(vault->updateCaseItem(1, {}));
        EXPECT_FALSE(vault->deleteCase(1));
        EXPECT_FALSE(vault->deleteCaseItem(1));
        EXPECT_FALSE(vault->containCase(1));
        EXPECT_TRUE(vault->getCaseList().isEmpty());
        EXPECT_TRUE(vault->getAllCase().isEmpty());
        EXPECT_TRUE(vault->getCaseInfoMap(1).isEmpty());
        EXPECT_TRUE(vault->getCaseItemList(1).isEmpty());
        EXPECT_TRUE(vault->getCaseItemIdSet(1).isEmpty());
        EXPECT_TRUE(vault->getCaseItemInfoMap(1).isEmpty());
        EXPECT_EQ(vault->getCaseDuration(1), std::make_pair(QString("0"), QString("0")));
        EXPECT_TRUE(vault->getCaseCoverImage(1).isEmpty());
    }
    QDir::setCurrent(previousCurrent);
    EXPECT_TRUE(QDir(m_dir.path()).isEmpty());
    if (!rootFolderBefore) {
        EXPECT_FALSE(QFileInfo::exists("/PluginDelvix"));
    }
    EXPECT_TRUE(logged("no database path"));
    EXPECT_TRUE(logged("Open case vault database fail"));
    EXPECT_TRUE(logged("prepare failed"));
}

TEST_F(CaseDatabaseTest, RefusedStatementsLeaveTheCaseMapAsTheFileIs)
{
    CaseDatabase vault(m_dir.path());
    const int kept = vault.addCase("Kept", "1", "r");
    const int itemId = vault.addCaseItem(kept, item(0, 1, "f"));
    const QVariantList casesBefore = vault.getAllCase();

    for (const char* event : {"INSERT", "UPDATE", "DELETE"}) {
        raw(QStringLiteral(
                "CREATE TRIGGER refuse%1 BEFORE %1 ON \"Case\" BEGIN SELECT RAISE(ABORT, 'refused'); END")
                .arg(event));
    }
    EXPECT_EQ(vault.addCase("New", "2", "r"), 0);
    EXPECT_FALSE(vault.updateCase(kept, {{"caseName", "Changed"}}));
    EXPECT_FALSE(vault.deleteCase(kept));
    EXPECT_TRUE(sameTree(vault.getAllCase(), casesBefore));
    EXPECT_TRUE(vault.containCase(kept));
    EXPECT_EQ(rawCount("CaseItem", kept), 1);
    EXPECT_TRUE(logged("refused"));

    // Tables dropped behind its back: writes fail, reads come back empty, the map stays true.
    for (const char* event : {"INSERT", "UPDATE", "DELETE"}) {
        raw(QStringLiteral("DROP TRIGGER refuse%1").arg(event));
    }
    raw("DROP TABLE CaseItem");
    EXPECT_EQ(vault.addCaseItem(kept, item(0, 1)), 0);
    EXPECT_FALSE(vault.updateCaseItem(itemId, {}));
    EXPECT_TRUE(vault.getCaseItemList(kept).isEmpty());
    EXPECT_TRUE(vault.getCaseItemInfoMap(itemId).isEmpty());
    const QVariantMap detail = vault.getCaseInfoMap(kept);
    EXPECT_EQ(detail.value("caseName"), "Kept");
    EXPECT_EQ(detail.value("startTimestamp"), "0");
    raw("DROP TABLE \"Case\"");
    EXPECT_EQ(vault.addCase("New", "2", "r"), 0);
    EXPECT_FALSE(vault.deleteCase(kept));
    EXPECT_FALSE(vault.updateCase(kept, {{"caseName", "Changed"}}));
    EXPECT_TRUE(sameTree(vault.getAllCase(), casesBefore));
}

TEST_F(CaseDatabaseTest, CallersOnSeveralThreadsLoseNoWrite)
{
    CaseDatabase vault(m_dir.path());
    const CaseDatabase copy(vault); // one thread works through a copy, which shares the lock
    constexpr int threadCount = 4;
    constexpr int rounds = 25;
    std::vector<std::vector<int>> caseIds(threadCount);
    std::vector<std::thread> threads;
    for (int t = 0; t < threadCount; ++t) {
        threads.emplace_back([&, t] {
            CaseDatabase local = t == 0 ? copy : vault;
            CaseDatabase& target = t == 0 ? local : vault;
            for (int i = 0; i < rounds; ++i) {
                const int caseId = target.addCase(QString("t%1-%2").arg(t).arg(i), "n", "r");
                caseIds[t].push_back(caseId);
                const int itemId = target.addCaseItem(caseId, item(i % 2, 1000 + i, "f"));
                target.addCaseItem(caseId, item(0, 2000 + i, "", "o"));
                target.updateCaseItem(itemId, {{"comment", "c"}});
                target.updateCase(caseId, {{"caseName", "renamed"}});
                target.getCaseInfoMap(caseId);
                target.getCaseList();
                target.getCaseItemList(caseId);
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(loggedErrors(), 0);
    EXPECT_EQ(vault.getAllCase().size(), threadCount * rounds);
    for (const std::vector<int>& ids : caseIds) {
        for (int caseId : ids) {
            ASSERT_GT(caseId, 0);
            EXPECT_EQ(vault.getCaseItemIdSet(caseId).size(), 2);
            EXPECT_EQ(vault.getCaseInfoMap(caseId).value("caseName"), "renamed");
        }
    }
    EXPECT_EQ(CaseDatabase(m_dir.path()).getAllCase().size(), threadCount * rounds);
}

TEST_F(CaseDatabaseTest, InstancesOnOneFileWritingAtOnceLoseNothing)
{
    CaseDatabase first(m_dir.path());
    CaseDatabase second(m_dir.path());
    const auto writer = [](CaseDatabase* vault) {
        for (int i = 0; i < 30; ++i) {
            vault->addCaseItem(vault->addCase("c", "n", "r"), item(0, i + 1));
        }
    };
    std::thread one(writer, &first);
    std::thread two(writer, &second);
    one.join();
    two.join();
    EXPECT_EQ(loggedErrors(), 0);
    EXPECT_EQ(raw("SELECT COUNT(*) FROM \"Case\""), QVariantList{60});
    EXPECT_EQ(raw("SELECT COUNT(*) FROM CaseItem"), QVariantList{60});
}

TEST_F(CaseDatabaseTest, CopiesShareConnectionCaseMapAndLifetime)
{
    QTemporaryDir otherDir;
    const qsizetype connectionsBefore = QSqlDatabase::connectionNames().size();
    auto original = std::make_unique<CaseDatabase>(m_dir.path());
    CaseDatabase copy(*original);
    CaseDatabase assigned(otherDir.path());
    EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore + 2);
    assigned = *original; // the other vault's connection goes with its last holder
    EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore + 1);

    const int caseId = copy.addCase("shared", "1", "r");
    EXPECT_TRUE(original->containCase(caseId));
    EXPECT_TRUE(assigned.containCase(caseId));
    EXPECT_TRUE(assigned.updateCase(caseId, {{"caseName", "renamed"}}));
    EXPECT_EQ(original->getCaseInfoMap(caseId).value("caseName"), "renamed");

    original.reset(); // the copies still use the connection
    EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore + 1);
    EXPECT_GT(copy.addCaseItem(caseId, item(0, 1, "f")), 0);
    EXPECT_EQ(assigned.getCaseCoverImage(caseId), QStringList{"f"});
    EXPECT_TRUE(copy.deleteCase(caseId));
    EXPECT_FALSE(assigned.containCase(caseId));
    EXPECT_EQ(loggedErrors(), 0);
}

TEST_F(CaseDatabaseTest, KilledWriterLosesNoAcknowledgedWrite)
{
    QProcess writer;
    writer.start(CASE_VAULT_PROBE, {"write", m_dir.path()});
    ASSERT_TRUE(writer.waitForStarted());
    QByteArray output;
    // The wait bound only keeps a hung writer from hanging the test.
    for (int waits = 0; waits < 300 && output.count("item") < 40 && writer.state() == QProcess::Running;
         ++waits) {
        writer.waitForReadyRead(1000);
        output += writer.readAllStandardOutput();
    }
    writer.kill();
    writer.waitForFinished();
    output += writer.readAllStandardOutput();

    CaseDatabase reopened(m_dir.path());
    int acknowledged = 0;
    for (const QByteArray& line : output.split('\n')) {
        const QList<QByteArray> words = line.split(' ');
        if (words.size() != 2 || words.at(1).isEmpty()) {
            continue; // the line the kill cut short
        }
        const int id = words.at(1).toInt();
        ASSERT_GT(id, 0) << line.constData();
        if (words.at(0) == "case") {
            EXPECT_TRUE(reopened.containCase(id)) << id;
        } else {
            EXPECT_FALSE(reopened.getCaseItemInfoMap(id).isEmpty()) << id;
        }
        ++acknowledged;
    }
    EXPECT_GE(acknowledged, 80);
}

TEST_F(CaseDatabaseTest, FullFolderRefusesWritesAndKeepsEarlierCases)
{
    QProcess writer;
    writer.start(CASE_VAULT_PROBE, {"full", m_dir.path()});
    ASSERT_TRUE(writer.waitForFinished(120000));
    const QByteArray output = writer.readAllStandardOutput();
    ASSERT_EQ(writer.exitStatus(), QProcess::NormalExit) << "the writer crashed";
    ASSERT_EQ(writer.exitCode(), 0) << output.constData();

    // What the writer was told, by round: a case id and an item id, 0 for refused.
    QMap<int, int> caseOfRound;
    QMap<int, int> itemOfRound;
    int refused = 0;
    int lastRound = -1;
    for (const QByteArray& line : output.split('\n')) {
        const QList<QByteArray> words = line.split(' ');
        if (words.size() < 3) {
            continue;
        }
        if (words.at(0) == "case") {
            lastRound = words.at(2).toInt();
            caseOfRound.insert(lastRound, words.at(1).toInt());
            refused += words.at(1).toInt() == 0;
        } else if (words.at(0) == "item" && words.size() == 4) {
            itemOfRound.insert(words.at(3).toInt(), words.at(1).toInt());
            refused += words.at(1).toInt() == 0;
        } else if (words.at(0) == "read") {
            EXPECT_EQ(words.at(2).toInt(), 1) << "a full folder must still read: " << line.constData();
        }
    }
    EXPECT_GE(refused, 5) << "the limit never refused a write:\n" << output.constData();
    ASSERT_GT(caseOfRound.value(lastRound), 0) << "no case once there was room again";
    EXPECT_GT(itemOfRound.value(lastRound), 0) << "no item once there was room again";

    // A fresh instance holds exactly what was acknowledged, as it was sent.
    CaseDatabase reopened(m_dir.path());
    int acknowledgedCases = 0;
    for (auto it = caseOfRound.cbegin(); it != caseOfRound.cend(); ++it) {
        if (it.value() <= 0) {
            continue;
        }
        ++acknowledgedCases;
        EXPECT_EQ(reopened.getCaseInfoMap(it.value()).value(KEY_CASE_NAME).toString(),
                  QStringLiteral("full case %1").arg(it.key()));
        const int itemId = itemOfRound.value(it.key());
        const QSet<int> items = reopened.getCaseItemIdSet(it.value());
        EXPECT_EQ(items, itemId > 0 ? QSet<int>{itemId} : QSet<int>{}) << "round " << it.key();
        if (itemId > 0) {
            const QVariantMap stored = reopened.getCaseItemInfoMap(itemId);
            EXPECT_EQ(stored.value(KEY_START_TIMESTAMP).toLongLong(), qint64(it.key()) * 1000 + 1);
            EXPECT_TRUE(
                stored.value(KEY_OBJ_IMAGE).toString().startsWith(QStringLiteral("image %1 ").arg(it.key())));
        }
    }
    EXPECT_EQ(reopened.getAllCase().size(), acknowledgedCases) << "a refused case was stored after all";
    EXPECT_EQ(raw(QStringLiteral("PRAGMA integrity_check")).value(0).toString(), QStringLiteral("ok"));
}

TEST_F(CaseDatabaseTest, FreshProcessReadsWhatThisOneWrote)
{
    CaseDatabase vault(m_dir.path());
    for (int c = 0; c < 3; ++c) {
        const int caseId = vault.addCase(QString("case %1").arg(c), "1234", "r");
        QVariantMap withTrajectory = item(0, 1700000000000 + c, "f", "o");
        withTrajectory.insert(KEY_TRAJECTORY, QVariantList{QVariantMap{{"x", 1}, {"y", 2}}});
        vault.addCaseItem(caseId, withTrajectory);
        vault.updateCaseItem(vault.addCaseItem(caseId, item(1, 1700000500000, "", "rec")),
                             {{"comment", "note"}, {"emapImageScale", 1.5}});
        vault.updateCase(caseId, {{"caseName", "renamed"}, {"description", "about"}});
    }
    vault.deleteCase(2);

    QProcess reader;
    reader.start(CASE_VAULT_PROBE, {"dump", m_dir.path()});
    ASSERT_TRUE(reader.waitForFinished(60000));
    ASSERT_EQ(reader.exitCode(), 0);
    QByteArray bytes = reader.readAllStandardOutput();
    QDataStream stream(&bytes, QIODevice::ReadOnly);
    QVariantMap fresh;
    stream >> fresh;
    ASSERT_EQ(fresh.value("allCase").toList().size(), 2);
    EXPECT_TRUE(sameTree(fresh, dumpCaseVault(vault)));
}

} // namespace
