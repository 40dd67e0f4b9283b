// The case vault on real SQLite files: what a fresh instance reads back after each write, the read
// models, the faults it must survive (no path, statements refused behind its back) and callers on
// several threads, instances and copies at once.

#include "CaseDatabase.h"
#include "DelvixKeys.h"

#include <QDateTime>
#include <QDir>
#include <QFileInfo>
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

// Runs one statement on a connection of the test's own, behind the vault's back; the first row.
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

// Each field of `expected` has its value in `stored`.
void expectFields(const QVariantMap& stored, const QVariantMap& expected)
{
    for (auto it = expected.cbegin(); it != expected.cend(); ++it) {
        EXPECT_EQ(stored.value(it.key()), it.value()) << qPrintable(it.key());
    }
}

class CaseDatabaseTest : public ::testing::Test
{
protected:
    void SetUp() override { ASSERT_TRUE(m_dir.isValid()); }
    QString vaultFile() const { return m_dir.path() + QStringLiteral("/PluginDelvix/CaseVault.db"); }
    QVariantList raw(const QString& statement, const QVariantList& values = {}) const
    {
        return rawRow(vaultFile(), statement, values);
    }
    CaseDatabase fresh() const { return CaseDatabase(m_dir.path()); }

    QTemporaryDir m_dir;
};

TEST_F(CaseDatabaseTest, WritesAreWhatAFreshInstanceReadsBack)
{
    CaseDatabase vault(m_dir.path());
    EXPECT_TRUE(QFileInfo::exists(vaultFile()));
    const qint64 before = QDateTime::currentSecsSinceEpoch();
    const int caseId = vault.addCase("Theft", "12345678", "Ann");
    const int other = vault.addCase("Other", "2", "r");
    ASSERT_GT(caseId, 0);
    ASSERT_GT(other, caseId);
    // The case map holds what the file holds, created time included.
    const QVariantMap added = fresh().getAllCase().value(0).toMap();
    EXPECT_EQ(vault.getAllCase().value(0), added);
    EXPECT_GE(added.value(KEY_CREATED_TIME).toLongLong(), before);
    EXPECT_LE(added.value(KEY_CREATED_TIME).toLongLong(), QDateTime::currentSecsSinceEpoch());
    EXPECT_EQ(added.value(KEY_DESCRIPTION).metaType(), QMetaType::fromType<QString>());

    // Update writes all four fields, a missing one as empty text; a missing case takes no update.
    EXPECT_TRUE(vault.updateCase(caseId, {{"caseName", "Theft 2"}, {"caseNumber", 42}, {"reporter", "Bo"}}));
    EXPECT_FALSE(vault.updateCase(other + 100, {{"caseName", "ghost"}}));
    EXPECT_FALSE(vault.containCase(other + 100));
    const QVariantMap updated{
        {"caseName", "Theft 2"}, {"caseNumber", "42"}, {"reporter", "Bo"}, {"description", ""}};
    expectFields(fresh().getCaseInfoMap(caseId), updated);
    expectFields(vault.getCaseInfoMap(caseId), updated);
    EXPECT_EQ(fresh().getCaseInfoMap(caseId).value(KEY_CREATED_TIME), added.value(KEY_CREATED_TIME));

    // Items: every field of the map is stored; absent ones take their defaults.
    const QVariantList trajectory{QVariantMap{{"x", 0.5}, {"y", 0.25}}};
    QVariantMap full = item(1, 1000, "face.jpg");
    full.insert({{KEY_TRAJECTORY, trajectory},
                 {KEY_BOOKMARK_ID, "77"},
                 {KEY_NEED_BOOKMARK, true},
                 {KEY_PREVIEW_IMAGE, "p"}});
    const int fullId = vault.addCaseItem(caseId, full);
    const int bareId = vault.addCaseItem(caseId, {{KEY_OBJ_IMAGE, "obj"}});
    const int otherItem = vault.addCaseItem(other, item(0, 3));
    ASSERT_GT(fullId, 0);
    ASSERT_GT(bareId, fullId);
    EXPECT_EQ(vault.addCaseItem(other + 100, item(0, 1)), 0); // the foreign key refuses it
    expectFields(fresh().getCaseItemList(caseId).value(0).toMap(), {{"showFacePhotoOnReport", true},
                                                                    {"showObjectPhotoOnReport", false},
                                                                    {"trajectory", trajectory},
                                                                    {"emapImageScale", -1.0},
                                                                    {"bookmarkId", "77"},
                                                                    {"previewImage", "p"},
                                                                    {"startTimestamp", 1000},
                                                                    {"endTimestamp", 2000},
                                                                    {"faceImage", "face.jpg"},
                                                                    {"nodeID", "cam1"},
                                                                    {"locID", "Loc1"},
                                                                    {"needBookmark", true},
                                                                    {"objType", 1}});
    expectFields(fresh().getCaseItemInfoMap(bareId), {{"showFacePhotoOnReport", false},
                                                      {"showObjectPhotoOnReport", true},
                                                      {"trajectory", QVariantList()}});

    EXPECT_TRUE(vault.updateCaseItem(fullId, {{"showFacePhotoOnReport", false},
                                              {"showObjectPhotoOnReport", 1},
                                              {"comment", "seen"},
                                              {"emapImageScale", 2.5},
                                              {"emapAngle", 90}}));
    EXPECT_TRUE(vault.updateCaseItem(bareId, {}));
    EXPECT_FALSE(vault.updateCaseItem(9999, {{"comment", "x"}}));
    expectFields(fresh().getCaseItemInfoMap(fullId), {{"showFacePhotoOnReport", false},
                                                      {"showObjectPhotoOnReport", true},
                                                      {"comment", "seen"},
                                                      {"emapImageScale", 2.5},
                                                      {"emapAngle", 90.0}});
    EXPECT_EQ(fresh().getCaseItemInfoMap(bareId).value("emapImageScale"), 0.0);

    EXPECT_TRUE(vault.deleteCaseItem(bareId));
    EXPECT_TRUE(vault.deleteCaseItem(9999));
    EXPECT_EQ(fresh().getCaseItemIdSet(caseId), QSet<int>{fullId});

    // Deleting a case takes its items along and leaves the others'; no such row is no failure.
    EXPECT_TRUE(vault.deleteCase(caseId));
    EXPECT_TRUE(vault.deleteCase(9999));
    EXPECT_FALSE(vault.containCase(caseId));
    EXPECT_TRUE(vault.getCaseInfoMap(caseId).isEmpty());
    EXPECT_EQ(raw("SELECT COUNT(*) FROM CaseItem WHERE caseId = ?", {caseId}), QVariantList{0});
    EXPECT_EQ(fresh().getCaseItemIdSet(other), QSet<int>{otherItem});
    EXPECT_EQ(fresh().getAllCase().size(), 1);

    // A case written by another program is seen by a new instance only.
    raw("INSERT INTO \"Case\" (name, createdTime) VALUES ('Outside', 1)");
    EXPECT_FALSE(vault.containCase(other + 1));
    EXPECT_TRUE(fresh().containCase(other + 1));
    // Nothing holds the file between operations.
    for (const QString& name : QSqlDatabase::connectionNames()) {
        EXPECT_FALSE(QSqlDatabase::database(name, false).isOpen()) << qPrintable(name);
    }
}

TEST_F(CaseDatabaseTest, ReadModelsOrderDurationsAndCovers)
{
    // An older file with only the case table gets its item table, and the index item reads use.
    QDir(m_dir.path()).mkdir("PluginDelvix");
    raw(SQL_CREATE_CASE_TABLE);
    for (int createdTime : {100, 300, 200}) {
        raw("INSERT INTO \"Case\" (name, createdTime) VALUES (?, ?)",
            {QString::number(createdTime), createdTime});
    }
    CaseDatabase vault(m_dir.path());
    EXPECT_EQ(raw("SELECT COUNT(*) FROM sqlite_master WHERE type = 'index' AND tbl_name = 'CaseItem'"),
              QVariantList{1});
    QList<uint> order;
    for (const QVariant& summary : vault.getCaseList()) {
        EXPECT_EQ(summary.toMap().value("createdTime").metaType(), QMetaType::fromType<uint>());
        order.append(summary.toMap().value("createdTime").toUInt());
    }
    EXPECT_EQ(order, (QList<uint>{300, 200, 100})); // newest first
    EXPECT_EQ(vault.getAllCase().value(1).toMap().value("caseId"), 2);
    const QVariantMap empty = vault.getCaseInfoMap(1);
    EXPECT_EQ(empty.value("coverImage").toStringList(), QStringList());
    EXPECT_EQ(empty.value("startTimestamp"), "0");
    EXPECT_EQ(empty.value("endTimestamp"), "0");
    EXPECT_TRUE(vault.getCaseInfoMap(99).isEmpty());

    // Durations are local minutes; a start of 0 is no start.
    const qint64 start = QDateTime(QDate(2024, 3, 5), QTime(14, 7, 30)).toMSecsSinceEpoch();
    const qint64 end = QDateTime(QDate(2024, 3, 6), QTime(9, 15, 59)).toMSecsSinceEpoch() - 1000;
    for (qint64 at : {start + 60000, start, end}) {
        vault.addCaseItem(2, item(0, at));
    }
    EXPECT_EQ(vault.getCaseDuration(2),
              std::make_pair(QString("2024-03-05 14:07"), QString("2024-03-06 09:15")));
    vault.addCaseItem(3, item(0, 0));
    vault.addCaseItem(3, item(0, end));
    EXPECT_EQ(vault.getCaseDuration(3).first, "0");
    EXPECT_EQ(vault.getCaseInfoMap(3).value("endTimestamp"), "2024-03-06 09:15");
    // The list and the single read agree; text that is not JSON reads as no trajectory.
    raw("UPDATE CaseItem SET trajectory = 'not json'");
    for (const QVariant& listed : vault.getCaseItemList(2)) {
        QVariantMap single = vault.getCaseItemInfoMap(listed.toMap().value("id").toInt());
        single.insert("needBookmark", false);
        single.insert("objType", 0);
        EXPECT_EQ(single, listed.toMap());
        EXPECT_EQ(single.value("trajectory"), QVariantList());
    }

    // Covers: up to three type-0 images, or one type-1 and one type-0, in start-time order. Rows
    // are written in reverse start-time order so that the statement's own order shows.
    struct Row
    {
        int type;
        const char* face;
        const char* object;
    };
    const std::vector<std::pair<std::vector<Row>, QStringList>> covers{
        {{{1, "", "rec"}, {0, "", "a"}, {0, "", "b"}}, {"rec", "a"}},
        {{{0, "", "a"}, {0, "", "b"}, {1, "", "rec"}, {0, "", "d"}}, {"a", "b", "d"}},
        {{{0, "", "a"}, {1, "", "rec"}, {1, "", "rec2"}}, {"a", "rec"}},
        {{{0, "face", "body"}, {0, "", ""}, {1, "", ""}, {0, "", "b"}}, {"face", "b"}},
        {{{0, "a", ""}, {0, "b", ""}, {0, "c", ""}, {0, "d", ""}}, {"a", "b", "c"}}};
    for (const auto& [rows, expected] : covers) {
        const int caseId = vault.addCase("c", "1", "r");
        for (int i = int(rows.size()) - 1; i >= 0; --i) {
            vault.addCaseItem(caseId, item(rows[i].type, 1000 * (i + 1), rows[i].face, rows[i].object));
        }
        EXPECT_EQ(vault.getCaseCoverImage(caseId), expected);
        EXPECT_EQ(vault.getCaseInfoMap(caseId).value("coverImage").toStringList(), expected);
    }
}

TEST_F(CaseDatabaseTest, EmptyPathMakesNoFileAndFailsEveryOperation)
{
    const bool rootFolderBefore = QFileInfo::exists("/PluginDelvix");
    const QString previousCurrent = QDir::currentPath();
    QDir::setCurrent(m_dir.path());
    for (CaseDatabase* vault : {new CaseDatabase(QString()), new CaseDatabase()}) {
        std::unique_ptr<CaseDatabase> owner(vault);
        EXPECT_EQ(vault->addCase("c", "1", "r") + vault->addCaseItem(1, item(0, 1)), 0);
        EXPECT_FALSE(vault->updateCase(1, {{"caseName", "x"}}) || vault->updateCaseItem(1, {}) ||
                     vault->deleteCase(1) || vault->deleteCaseItem(1) || vault->containCase(1));
        EXPECT_TRUE(vault->getCaseList().isEmpty() && vault->getCaseInfoMap(1).isEmpty() &&
                    vault->getCaseItemList(1).isEmpty() && vault->getCaseItemInfoMap(1).isEmpty() &&
                    vault->getCaseCoverImage(1).isEmpty());
        EXPECT_EQ(vault->getCaseDuration(1), std::make_pair(QString("0"), QString("0")));
    }
    QDir::setCurrent(previousCurrent);
    EXPECT_TRUE(QDir(m_dir.path()).isEmpty());
    EXPECT_EQ(QFileInfo::exists("/PluginDelvix"), rootFolderBefore);
}

TEST_F(CaseDatabaseTest, RefusedStatementsLeaveTheCaseMapAsTheFileIs)
{
    CaseDatabase vault(m_dir.path());
    const int kept = vault.addCase("Kept", "1", "r");
    const int itemId = vault.addCaseItem(kept, item(0, 1, "f"));
    const QVariantList casesBefore = vault.getAllCase();
    for (const char* event : {"INSERT", "UPDATE", "DELETE"}) {
        raw(QStringLiteral(
                "CREATE TRIGGER refuse%1 BEFORE %1 ON \"Case\" BEGIN SELECT RAISE(ABORT, 'no'); END")
                .arg(event));
    }
    EXPECT_EQ(vault.addCase("New", "2", "r"), 0);
    EXPECT_FALSE(vault.updateCase(kept, {{"caseName", "Changed"}}));
    EXPECT_FALSE(vault.deleteCase(kept));
    EXPECT_EQ(vault.getAllCase(), casesBefore);
    EXPECT_EQ(fresh().getCaseItemIdSet(kept), QSet<int>{itemId});

    // Tables dropped behind its back: writes fail, reads come back empty, the map stays true.
    raw("DROP TABLE CaseItem");
    EXPECT_EQ(vault.addCaseItem(kept, item(0, 1)), 0);
    EXPECT_FALSE(vault.updateCaseItem(itemId, {}));
    EXPECT_TRUE(vault.getCaseItemList(kept).isEmpty());
    EXPECT_EQ(vault.getCaseInfoMap(kept).value("caseName"), "Kept");
    raw("DROP TABLE \"Case\"");
    EXPECT_EQ(vault.addCase("New", "2", "r"), 0);
    EXPECT_FALSE(vault.deleteCase(kept));
    EXPECT_EQ(vault.getAllCase(), casesBefore);
}

TEST_F(CaseDatabaseTest, ThreadsInstancesAndCopiesLoseNoWrite)
{
    const qsizetype connectionsBefore = QSqlDatabase::connectionNames().size();
    {
        CaseDatabase vault(m_dir.path());
        CaseDatabase second(m_dir.path()); // a connection of its own on the same file
        auto original = std::make_unique<CaseDatabase>(m_dir.path());
        CaseDatabase copy(*original); // copies share the connection, the case map and the lock
        EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore + 3);
        second = *original; // the second vault's connection goes with its last holder
        EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore + 2);
        const int shared = copy.addCase("shared", "1", "r");
        EXPECT_TRUE(second.updateCase(shared, {{"caseName", "renamed"}}));
        EXPECT_EQ(original->getCaseInfoMap(shared).value("caseName"), "renamed");
        EXPECT_FALSE(vault.containCase(shared)); // each instance maps what it loaded or wrote
        original.reset();                        // the copies still use the connection
        EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore + 2);
        EXPECT_TRUE(copy.deleteCase(shared));
        EXPECT_FALSE(second.containCase(shared));

        constexpr int threadCount = 4;
        constexpr int rounds = 20;
        std::vector<std::vector<int>> caseIds(threadCount);
        std::vector<std::thread> threads;
        for (int t = 0; t < threadCount; ++t) {
            threads.emplace_back([&, t] {
                // Two threads on one instance, one on a copy of it, one on another instance.
                CaseDatabase& target = t == 0 ? copy : t == 1 ? second : vault;
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
        CaseDatabase reopened = fresh();
        EXPECT_EQ(reopened.getAllCase().size(), threadCount * rounds);
        EXPECT_EQ(vault.getAllCase().size() + copy.getAllCase().size(), threadCount * rounds);
        for (const std::vector<int>& ids : caseIds) {
            for (int caseId : ids) {
                ASSERT_GT(caseId, 0);
                EXPECT_EQ(reopened.getCaseInfoMap(caseId).value("caseName"), "renamed");
                const QVariantList items = reopened.getCaseItemList(caseId);
                ASSERT_EQ(items.size(), 2);
                EXPECT_EQ(items.value(0).toMap().value("comment"), "c");
            }
        }
    }
    EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore);
}

} // namespace
