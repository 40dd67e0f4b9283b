// The case vault on real SQLite files: what a fresh instance reads back, the read models, the
// faults it must survive and callers on several threads, instances and copies at once.

#include "CaseDatabase.h"
#include "DelvixKeys.h"

#include <QDateTime>
#include <QDir>
#include <QJsonDocument>
#include <QSqlDatabase>
#include <QSqlQuery>
#include <QTemporaryDir>
#include <gtest/gtest.h>
#include <thread>
#include <vector>

namespace {

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

// The map as compact JSON, so that one comparison shows every field.
std::string json(const QVariantMap& map)
{
    return QJsonDocument::fromVariant(map).toJson(QJsonDocument::Compact).toStdString();
}

class CaseDatabaseTest : public ::testing::Test
{
protected:
    // Runs one statement on a connection of the test's own, behind the vault's back; the first value.
    QVariant raw(const QString& statement, const QVariantList& values = {}) const
    {
        QVariant first;
        {
            QSqlDatabase db = QSqlDatabase::addDatabase(QStringLiteral("QSQLITE"), QStringLiteral("raw"));
            db.setDatabaseName(m_dir.path() + QStringLiteral("/PluginDelvix/CaseVault.db"));
            QSqlQuery query(db);
            if (db.open() && query.prepare(statement)) {
                for (const QVariant& value : values) {
                    query.addBindValue(value);
                }
                first = query.exec() && query.next() ? query.value(0) : QVariant();
            }
        }
        QSqlDatabase::removeDatabase(QStringLiteral("raw"));
        return first;
    }
    CaseDatabase fresh() const { return CaseDatabase(m_dir.path()); }

    QTemporaryDir m_dir;
};

TEST_F(CaseDatabaseTest, WritesAreWhatAFreshInstanceReadsBack)
{
    CaseDatabase vault(m_dir.path());
    const qint64 before = QDateTime::currentSecsSinceEpoch();
    const int caseId = vault.addCase("Theft", "12345678", "Ann");
    const int other = vault.addCase("Other", "2", "r");
    ASSERT_TRUE(caseId > 0 && other > caseId);
    // The case map holds what the file holds, created time included.
    QVariantMap added = fresh().getAllCase().value(0).toMap();
    EXPECT_EQ(vault.getAllCase().value(0), added);
    EXPECT_GE(added.take(KEY_CREATED_TIME).toLongLong(), before);
    EXPECT_EQ(json(added),
              R"({"caseId":1,"caseName":"Theft","caseNumber":"12345678","description":"","reporter":"Ann"})");

    // Update writes all four fields, a missing one as empty text; a missing case takes no update.
    QVariantMap fields{{"caseName", "T2"}, {"caseNumber", 42}, {"reporter", "Bo"}, {"description", "d"}};
    EXPECT_TRUE(vault.updateCase(caseId, fields));
    fields.remove("description");
    EXPECT_TRUE(vault.updateCase(caseId, fields) && !vault.updateCase(other + 100, fields));
    QVariantMap updated = fresh().getAllCase().value(0).toMap();
    EXPECT_EQ(vault.getAllCase().value(0), updated);
    EXPECT_EQ(updated.take(KEY_CREATED_TIME), vault.getCaseInfoMap(caseId).value(KEY_CREATED_TIME));
    EXPECT_EQ(json(updated),
              R"({"caseId":1,"caseName":"T2","caseNumber":"42","description":"","reporter":"Bo"})");

    // Items: every field of the map is stored; absent ones take their defaults.
    QVariantMap full = item(1, 1000, "face.jpg");
    full.insert({{KEY_TRAJECTORY, QVariantList{QVariantMap{{"x", 0.5}}}},
                 {KEY_BOOKMARK_ID, "77"},
                 {KEY_NEED_BOOKMARK, true},
                 {KEY_PREVIEW_IMAGE, "p"}});
    const int fullId = vault.addCaseItem(caseId, full);
    const int bareId = vault.addCaseItem(caseId, {{KEY_OBJ_IMAGE, "obj"}});
    const int otherItem = vault.addCaseItem(other, item(0, 3));
    ASSERT_GT(bareId, fullId);
    EXPECT_EQ(vault.addCaseItem(other + 100, item(0, 1)), 0); // the foreign key refuses it
    EXPECT_EQ(json(fresh().getCaseItemList(caseId).value(0).toMap()),
              R"({"bookmarkId":"77","comment":"","emapAngle":0,"emapImageScale":-1,)"
              R"("endTimestamp":2000,"faceImage":"face.jpg","id":1,)"
              R"("locID":"Loc1","needBookmark":true,"nodeID":"cam1","objImage":"","objType":1,)"
              R"("previewImage":"p","showFacePhotoOnReport":true,"showObjectPhotoOnReport":false,)"
              R"("startTimestamp":1000,"trajectory":[{"x":0.5}]})");
    EXPECT_EQ(
        json(fresh().getCaseItemInfoMap(bareId)),
        R"({"bookmarkId":"","comment":"","emapAngle":0,"emapImageScale":-1,"endTimestamp":0,"faceImage":"",)"
        R"("id":2,"locID":"","nodeID":"","objImage":"obj","previewImage":"","showFacePhotoOnReport":false,)"
        R"("showObjectPhotoOnReport":true,"startTimestamp":0,"trajectory":[]})");
    EXPECT_TRUE(vault.updateCaseItem(fullId, {{"showFacePhotoOnReport", false},
                                              {"showObjectPhotoOnReport", 1},
                                              {"comment", "seen"},
                                              {"emapImageScale", 2.5},
                                              {"emapAngle", 90}}));
    EXPECT_TRUE(vault.updateCaseItem(bareId, {}) && !vault.updateCaseItem(9999, {{"comment", "x"}}));
    EXPECT_EQ(json(fresh().getCaseItemInfoMap(fullId)),
              R"({"bookmarkId":"77","comment":"seen","emapAngle":90,"emapImageScale":2.5,)"
              R"("endTimestamp":2000,"faceImage":"face.jpg","id":1,)"
              R"("locID":"Loc1","nodeID":"cam1","objImage":"","previewImage":"p",)"
              R"("showFacePhotoOnReport":false,"showObjectPhotoOnReport":true,)"
              R"("startTimestamp":1000,"trajectory":[{"x":0.5}]})");
    EXPECT_EQ(fresh().getCaseItemInfoMap(bareId).value("emapImageScale"), 0.0); // update writes all
    EXPECT_TRUE(vault.deleteCaseItem(bareId) && vault.deleteCaseItem(9999));
    EXPECT_EQ(fresh().getCaseItemIdSet(caseId), QSet<int>{fullId});
    // Deleting a case takes its items along and leaves the others'; no such row is no failure.
    EXPECT_TRUE(vault.deleteCase(caseId) && vault.deleteCase(9999));
    EXPECT_FALSE(vault.containCase(caseId) || !vault.getCaseInfoMap(caseId).isEmpty());
    EXPECT_EQ(raw("SELECT COUNT(*) FROM CaseItem WHERE caseId = ?", {caseId}), 0);
    EXPECT_EQ(fresh().getCaseItemIdSet(other), QSet<int>{otherItem});
    EXPECT_EQ(fresh().getAllCase().size(), 1);

    // Nothing holds the file between operations.
    for (const QString& name : QSqlDatabase::connectionNames()) {
        EXPECT_FALSE(QSqlDatabase::database(name, false).isOpen()) << qPrintable(name);
    }
}

TEST_F(CaseDatabaseTest, ReadModelsOrderDurationsAndCovers)
{
    // An older file with only the case table gets its item table.
    QDir(m_dir.path()).mkdir("PluginDelvix");
    raw(SQL_CREATE_CASE_TABLE);
    for (int createdTime : {100, 300, 200}) {
        raw("INSERT INTO \"Case\" (name, createdTime) VALUES (?, ?)",
            {QString::number(createdTime), createdTime});
    }
    CaseDatabase vault(m_dir.path());
    QList<uint> order;
    for (const QVariant& summary : vault.getCaseList()) {
        order.append(summary.toMap().value("createdTime").toUInt());
    }
    EXPECT_EQ(order, (QList<uint>{300, 200, 100})); // newest first

    // Durations are local minutes.
    const qint64 start = QDateTime(QDate(2024, 3, 5), QTime(14, 7, 30)).toMSecsSinceEpoch();
    const qint64 end = QDateTime(QDate(2024, 3, 6), QTime(9, 15, 59)).toMSecsSinceEpoch() - 1000;
    for (qint64 at : {start + 60000, start, end}) {
        vault.addCaseItem(2, item(0, at));
    }
    EXPECT_EQ(vault.getCaseDuration(2),
              std::make_pair(QString("2024-03-05 14:07"), QString("2024-03-06 09:15")));

    // Covers: up to three type-0 images, or one type-1 and one type-0, in start-time order. Rows
    // are written in reverse start-time order so that the statement's own order shows.
    const std::vector<std::pair<QStringList, QStringList>> covers{
        {{"1/rec", "0/a", "0/b"}, {"rec", "a"}},
        {{"0/a", "0/b", "1/rec", "0/d"}, {"a", "b", "d"}},
        {{"0/a", "1/rec", "1/rec2"}, {"a", "rec"}},
        {{"0face/body", "0/", "1/", "0/b"}, {"face", "b"}},
        {{"0a/", "0b/", "0c/", "0d/"}, {"a", "b", "c"}}};
    for (const auto& [rows, expected] : covers) {
        const int caseId = vault.addCase("c", "1", "r");
        for (int i = int(rows.size()) - 1; i >= 0; --i) {
            const QStringList images = rows[i].mid(1).split('/');
            vault.addCaseItem(caseId, item(rows[i].left(1).toInt(), 1000 * (i + 1), images[0], images[1]));
        }
        EXPECT_EQ(vault.getCaseCoverImage(caseId), expected);
        EXPECT_EQ(vault.getCaseInfoMap(caseId).value("coverImage").toStringList(), expected);
    }
}

TEST_F(CaseDatabaseTest, WithoutPathOrWithStatementsRefusedTheFileStaysTrue)
{
    // No path: no file (in the working folder either), and every operation fails.
    const QString previousCurrent = QDir::currentPath();
    QDir::setCurrent(m_dir.path());
    CaseDatabase pathless{QString()};
    EXPECT_EQ(pathless.addCase("c", "1", "r") + pathless.addCaseItem(1, item(0, 1)), 0);
    EXPECT_FALSE(pathless.updateCase(1, {{"caseName", "x"}}) || pathless.updateCaseItem(1, {}) ||
                 pathless.deleteCase(1) || pathless.deleteCaseItem(1) || pathless.containCase(1));
    EXPECT_TRUE(pathless.getCaseList().isEmpty() && pathless.getCaseItemList(1).isEmpty() &&
                pathless.getCaseItemInfoMap(1).isEmpty() && pathless.getCaseCoverImage(1).isEmpty());
    QDir::setCurrent(previousCurrent);
    EXPECT_TRUE(QDir(m_dir.path()).isEmpty());

    CaseDatabase vault(m_dir.path());
    const int kept = vault.addCase("Kept", "1", "r");
    const int itemId = vault.addCaseItem(kept, item(0, 1, "f"));
    const QVariantList casesBefore = vault.getAllCase();
    for (const char* event : {"INSERT", "UPDATE", "DELETE"}) {
        raw(QStringLiteral(
                "CREATE TRIGGER refuse%1 BEFORE %1 ON \"Case\" BEGIN SELECT RAISE(ABORT, 'no'); END")
                .arg(event));
    }
    EXPECT_FALSE(vault.addCase("New", "2", "r") || vault.updateCase(kept, {{"caseName", "Changed"}}) ||
                 vault.deleteCase(kept));
    EXPECT_EQ(vault.getAllCase(), casesBefore);
    EXPECT_EQ(fresh().getCaseItemIdSet(kept), QSet<int>{itemId});

    // Tables dropped behind its back: writes fail, reads come back empty, the map stays true.
    raw("DROP TABLE CaseItem");
    EXPECT_FALSE(vault.addCaseItem(kept, item(0, 1)) || vault.updateCaseItem(itemId, {}) ||
                 !vault.getCaseItemList(kept).isEmpty());
    raw("DROP TABLE \"Case\"");
    EXPECT_FALSE(vault.addCase("New", "2", "r") || vault.deleteCase(kept));
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
        second = *original;           // the second vault's connection goes with its last holder
        EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore + 2);
        const int shared = copy.addCase("shared", "1", "r");
        EXPECT_TRUE(second.updateCase(shared, {{"caseName", "renamed"}}));
        EXPECT_EQ(original->getCaseInfoMap(shared).value("caseName"), "renamed");
        original.reset(); // the copies still use the connection
        EXPECT_TRUE(copy.deleteCase(shared) && !second.containCase(shared));

        // Two threads on one instance, one on a copy of it, one on another instance. Few rounds:
        // the two instances wait on each other's file lock, which takes long on a loaded machine.
        constexpr int threadCount = 4, rounds = 8;
        std::vector<std::thread> threads;
        for (int t = 0; t < threadCount; ++t) {
            threads.emplace_back([&, t] {
                CaseDatabase& target = t == 0 ? copy : t == 1 ? second : vault;
                for (int i = 0; i < rounds; ++i) {
                    const int caseId = target.addCase(QString("t%1-%2").arg(t).arg(i), "n", "r");
                    target.updateCaseItem(target.addCaseItem(caseId, item(i % 2, 1000 + i, "f")),
                                          {{"comment", "c"}});
                    target.addCaseItem(caseId, item(0, 2000 + i, "", "o"));
                    target.updateCase(caseId, {{"caseName", "renamed"}});
                    target.getCaseInfoMap(caseId), target.getCaseItemList(caseId); // reads among the writes
                }
            });
        }
        for (std::thread& thread : threads) {
            thread.join();
        }
        // Every case holds its own two items, the first commented, under its new name.
        CaseDatabase reopened = fresh();
        QStringList cases;
        for (const QVariant& element : reopened.getAllCase()) {
            const QVariantList items = reopened.getCaseItemList(element.toMap().value(KEY_CASE_ID).toInt());
            cases << element.toMap().value("caseName").toString() + QString::number(items.size()) +
                         items.value(0).toMap().value("comment").toString();
        }
        EXPECT_EQ(cases, QStringList(threadCount * rounds, "renamed2c"));
        EXPECT_EQ(vault.getAllCase().size() + copy.getAllCase().size(), threadCount * rounds);
    }
    EXPECT_EQ(QSqlDatabase::connectionNames().size(), connectionsBefore);
}

} // namespace
