// The plug-in object: dispatch, its case vault's lifecycle, the case commands, add batches and
// bookmarks against the host's real bookmark plug-ins, relay and server-information plug-in.

#include "PluginDelvixSrv.h"
#include "BookmarkPlugin.h"
#include "CaseDatabase.h"
#include "DelvixKeys.h"
#include "Faults.h"
#include "HostFakes.h"
#include "HostPluginManager.h"
#include "HostRelaySender.h"
#include "PluginServerInfo.h"
#include "ReplyRecorder.h"

#include <QDir>
#include <QFileInfo>
#include <QJsonDocument>
#include <QTemporaryDir>
#include <gtest/gtest.h>
#include <memory>
#include <thread>
#include <vector>

namespace {

// A bookmark plug-in that keeps the callbacks and answers only when the test does.
class HoldingBookmarkPlugin : public QObject
{
    Q_OBJECT
public:
    QList<HDLR_DO_REQUEST_CB> callbacks;
    Q_INVOKABLE void AddBookmark(const QVariant&, const RequestSenderInfo&,
                                 const HDLR_DO_REQUEST_CB& callback)
    {
        callbacks.append(callback);
    }
};

// Fails the item updates of the ids in `failing`.
class FailingUpdateDatabase : public CaseDatabase
{
public:
    using CaseDatabase::CaseDatabase;
    QSet<int> failing;
    bool updateCaseItem(int itemId, const QVariantMap& fields) override
    {
        return !failing.contains(itemId) && CaseDatabase::updateCaseItem(itemId, fields);
    }
    QVariantList getCaseList() override
    {
        return failing.contains(-1) ? throw std::bad_alloc() : CaseDatabase::getCaseList();
    }
};

QVariantMap item(const QString& nodeId, bool needBookmark, qint64 start = 1700000000000,
                 const QString& bookmark = {})
{
    QVariantMap map{{KEY_NODE_ID, nodeId},
                    {KEY_LOC_ID, QStringLiteral("Loc3")},
                    {KEY_START_TIMESTAMP, start},
                    {KEY_END_TIMESTAMP, start + 60000},
                    {KEY_CASE_ITEM_TYPE, 0},
                    {KEY_OBJ_IMAGE, QStringLiteral("aW1n")},
                    {KEY_NEED_BOOKMARK, needBookmark}};
    bookmark.isNull() ? void() : void(map.insert(KEY_BOOKMARK_ID, bookmark));
    return map;
}
QVariantMap batch(const QString& name, const QVariantList& items)
{
    return {{KEY_CASE_NAME, name}, {KEY_CASE_ITEM, items}};
}
QVariantMap single(const QString& name, const QVariantMap& item)
{
    return {{KEY_CASE_NAME, name}, {KEY_CASE_ITEM, item}};
}
const auto caseIdOf = [](const Reply& reply) { return reply.payload.toMap().value(KEY_CASE_ID).toInt(); };

// The replies as one text: "count final code 'message' [payload]" of the last.
std::string summary(const ReplyRecorder& recorder)
{
    const Reply last = recorder.last();
    const QByteArray payload =
        QJsonDocument::fromVariant(QVariantList{last.payload}).toJson(QJsonDocument::Compact);
    return QStringLiteral("%1 %2 %3 '%4' %5")
        .arg(recorder.replies().size())
        .arg(last.final)
        .arg(last.code, last.message, QString::fromUtf8(payload))
        .toStdString();
}
// What summary() gives for `count` replies ending in a final one with `code` and no payload.
std::string answered(const QString& code, int count = 1)
{
    return std::to_string(count) + " 1 " + code.toStdString() + " '' [null]";
}

class PluginCasesTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        // The server's database folders exist; the vault makes only its own folder inside.
        for (const char* folder : {"db", "db2", "db3"}) {
            ASSERT_TRUE(QDir(m_dir.path()).mkpath(QLatin1String(folder)));
        }
        m_manager.registerPluginObject(PLUGIN_ID_SERVER_INFO, &m_serverInfo);
        m_manager.registerPluginObject(PLUGIN_ID_BOOKMARK, &m_bookmarks);
        m_remoteManager.registerPluginObject(PLUGIN_ID_BOOKMARK, &m_remoteBookmarks);
        m_relay.addRemoteServer(QStringLiteral("east"), &m_remoteManager);
        m_plugin->InitialPluginBase(&m_tools);
        m_plugin->AllPluginLoaded();
    }

    QString path(const char* folder) const { return m_dir.filePath(QLatin1String(folder)); }

    // Sends one request from this thread and waits for its final reply.
    ReplyRecorder& send(const QString& command, const QVariant& params)
    {
        ReplyRecorder& recorder = *m_recorders.emplace_back(std::make_unique<ReplyRecorder>());
        m_plugin->Request(command, params, m_sender, recorder.callback());
        recorder.waitFinal();
        return recorder;
    }
    Reply call(const QString& command, const QVariant& params) { return send(command, params).last(); }
    CaseDatabase vault(const char* folder = "db") const { return CaseDatabase(path(folder)); }
    // The item count of each case in the vault at `folder`, in case order.
    QList<int> itemCounts(const char* folder = "db") const
    {
        CaseDatabase database = vault(folder);
        QList<int> counts;
        for (const QVariant& element : database.getAllCase()) {
            counts << database.getCaseItemList(element.toMap().value(KEY_CASE_ID).toInt()).size();
        }
        return counts;
    }

    QTemporaryDir m_dir;
    PluginServerInfo m_serverInfo{path("db")};
    BookmarkPlugin m_bookmarks{m_dir.filePath(QStringLiteral("bookmarks.json"))};
    BookmarkPlugin m_remoteBookmarks{m_dir.filePath(QStringLiteral("remote.json"))};
    HostPluginManager m_manager, m_remoteManager;
    HostRelaySender m_relay;
    TestTools m_tools{&m_manager, nullptr, &m_relay};
    std::unique_ptr<PluginDelvixSrv> m_plugin = std::make_unique<PluginDelvixSrv>();
    RequestSenderInfo m_sender;
    std::vector<std::unique_ptr<ReplyRecorder>> m_recorders;
};

} // namespace

TEST(PluginDelvixSrvDispatch, RefusalsAnswerOnceAndFinal)
{
    PluginDelvixSrv plugin;
    // Outside text is never a format; a case command before AllPluginLoaded has no vault.
    for (const auto& [command, code] :
         std::vector<std::pair<QString, QString>>{{"noSuchCommand", RC_COMMAND_NOT_SUPPORTED},
                                                  {"%s%s%s%n", RC_COMMAND_NOT_SUPPORTED},
                                                  {CMD_ADD_CASE_WITH_RECORDINGS, RC_FAILURE},
                                                  {CMD_GET_CASE_LIST, RC_FAILURE}}) {
        ReplyRecorder recorder;
        plugin.Request(command, QVariantMap{{"a", 1}}, RequestSenderInfo{}, recorder.callback());
        EXPECT_EQ(summary(recorder), answered(code)) << qPrintable(command);
    }
}

TEST_F(PluginCasesTest, VaultFollowsTheServerPath)
{
    ASSERT_EQ(call(CMD_ADD_CASE_WITH_ITEM, single("in db", item("c1", false))).code, RC_SUCCESS);
    vault("db3").addCase(QStringLiteral("in db3"), QStringLiteral("1"), QString());
    // Two changes in a row: the second path's vault is the one in use.
    m_serverInfo.setServerDatabasePath(path("db2"));
    m_serverInfo.setServerDatabasePath(path("db3"));
    const QVariantList listed = call(CMD_GET_CASE_LIST, QVariant()).payload.toList();
    EXPECT_EQ(listed.size() == 1 ? listed[0].toMap().value(KEY_CASE_NAME) : QVariant(), "in db3");
    EXPECT_EQ(vault("db").getAllCase().value(0).toMap().value(KEY_CASE_NAME), "in db");
}

TEST_F(PluginCasesTest, BatchesBookmarkWhereTheNodeLivesAndDeletesTakeTheBookmarksAlong)
{
    const Reply plain =
        call(CMD_ADD_CASE_WITH_RECORDINGS, batch("plain", {item("c1", false), item("c2", false)}));
    // Bookmarks are made here and through the relay; an item keeps a bookmark id of its own.
    const Reply marked = call(CMD_ADD_CASE_WITH_RECORDINGS,
                              batch("marked", {item("c1", true, 1000, "mine"), item("east/c2", true, 2000)}));
    ASSERT_EQ(marked.code, RC_SUCCESS);
    QSet<QString> stored;
    for (const QVariant& element : vault().getCaseItemList(caseIdOf(marked))) {
        stored << element.toMap().value(KEY_BOOKMARK_ID).toString();
    }
    EXPECT_EQ(m_bookmarks.bookmarks().size(), 1); // made, though the item kept its own id
    ASSERT_EQ(m_remoteBookmarks.bookmarks().size(), 1);
    EXPECT_EQ(stored, (QSet<QString>{"mine", m_remoteBookmarks.bookmarks().keys().first()}));
    const QVariantMap made = m_remoteBookmarks.bookmarks().values().first();
    EXPECT_EQ(QVariantList({made[KEY_BM_CAMERA_ID], made[KEY_BM_CREATOR], made[KEY_BM_GROUP],
                            made[KEY_BM_LOCATION_ID]}),
              QVariantList({"c2", "admin", "CaseVault", "Loc3"}));

    // A bookmark refused here or remotely, or on an unknown server, leaves its item out and ends the
    // batch with failure; the case stays empty.
    for (const auto& [failing, node] : {std::pair{&m_bookmarks, "c1"},
                                        {&m_remoteBookmarks, "east/c2"},
                                        {static_cast<BookmarkPlugin*>(nullptr), "west/c2"}}) {
        failing ? failing->setAnswerMode(BookmarkPlugin::AnswerMode::Fail) : void();
        const QVariantMap one = single(node, item(node, true));
        EXPECT_EQ(summary(send(CMD_ADD_CASE_WITH_ITEM, one)), answered(RC_FAILURE, 2)) << node;
        failing ? failing->setAnswerMode(BookmarkPlugin::AnswerMode::Normal) : void();
    }
    EXPECT_EQ(itemCounts(), QList<int>({2, 2, 0, 0, 0}));

    // Deleted items take their bookmarks along, each where it lives; items without one ask nothing.
    const int requestsBefore = m_bookmarks.requestCount();
    EXPECT_EQ(call(CMD_DELETE_CASE, caseIdOf(plain)).code + call(CMD_DELETE_CASE, caseIdOf(marked)).code,
              RC_SUCCESS + RC_SUCCESS);
    ASSERT_TRUE(waitFor([&] { return m_remoteBookmarks.bookmarks().isEmpty(); }));
    EXPECT_TRUE(waitFor([&] { return m_bookmarks.requestCount() == requestsBefore + 1; }));
}

TEST_F(PluginCasesTest, BatchesAreAnsweredOnceWhateverTheBookmarkPluginDoes)
{
    HoldingBookmarkPlugin holding;
    m_manager.registerPluginObject(PLUGIN_ID_BOOKMARK, &holding);
    const QVariantMap bookmark{{KEY_BM_BOOKMARK_ID, QStringLiteral("b1")}};
    auto answer = [&](int i) { holding.callbacks[i](true, RC_SUCCESS, QString(), bookmark); };
    const QVariantMap twoItems = batch("two", {item("c1", true), item("c2", true)});
    // Double and late answers count once; a request released unanswered is a failed bookmark.
    ReplyRecorder twice, dropped;
    m_plugin->Request(CMD_ADD_CASE_WITH_RECORDINGS, twoItems, m_sender, twice.callback());
    m_plugin->Request(CMD_ADD_CASE_WITH_RECORDINGS, twoItems, m_sender, dropped.callback());
    ASSERT_EQ(holding.callbacks.size(), 4);
    const HDLR_DO_REQUEST_CB late = holding.callbacks[1];
    for (int i : {0, 0, 1, 2}) {
        answer(i);
    }
    holding.callbacks.clear();
    ASSERT_TRUE(twice.waitFinal() && dropped.waitFinal());
    late(true, RC_SUCCESS, QString(), bookmark);
    QCoreApplication::processEvents();
    EXPECT_EQ(
        std::tuple(twice.replies().size(), twice.last().code, dropped.replies().size(), dropped.last().code),
        std::tuple(3u, RC_SUCCESS, 3u, RC_FAILURE));
    EXPECT_EQ(itemCounts(), QList<int>({2, 1}));

    // A client that adds again from its final reply, on the plug-in's thread, gets both answers.
    ReplyRecorder second;
    const HDLR_DO_REQUEST_CB again = second.callback();
    m_plugin->Request(CMD_ADD_CASE_WITH_ITEM, batch("first", {item("c1", false)}), m_sender,
                      [&](bool final, const QString&, const QString&, const QVariant&) {
                          final ? m_plugin->Request(CMD_ADD_CASE_WITH_ITEM,
                                                    batch("second", {item("c2", false)}), m_sender, again)
                                : void();
                      });
    ASSERT_TRUE(second.waitFinal());
    EXPECT_EQ(itemCounts(), QList<int>({2, 1, 1, 1}));

    // The plug-in goes while bookmarks are answered on another thread. A progress reply that is
    // under way there when the plug-in goes (held until the final reply came) must not follow it.
    ReplyRecorder waiting;
    const HDLR_DO_REQUEST_CB record = waiting.callback();
    const std::thread::id testThread = std::this_thread::get_id();
    std::atomic<bool> held{false};
    const auto holdOne = [&](bool final, const QString& code, const QString& message,
                             const QVariant& payload) {
        if (!final && std::this_thread::get_id() != testThread && !held.exchange(true)) {
            for (int i = 0; i < 2000 && waiting.finalCount() == 0; ++i) {
                std::this_thread::sleep_for(std::chrono::milliseconds(1));
            }
        }
        record(final, code, message, payload);
    };
    m_plugin->Request(CMD_ADD_CASE_WITH_RECORDINGS, batch("many", QVariantList(1000, item("c1", true))),
                      m_sender, holdOne);
    ASSERT_EQ(holding.callbacks.size(), 1000);
    std::atomic<int> given{0};
    std::thread answering([&] {
        for (int i = 0; i < 999; ++i, ++given) {
            answer(i);
        }
    });
    while (given < 100 && !held) {
        std::this_thread::yield();
    }
    m_plugin.reset();
    answering.join();
    QCoreApplication::processEvents();
    EXPECT_TRUE(waiting.finalCount() == 1 && waiting.last().final);
    EXPECT_EQ(itemCounts(), QList<int>({2, 1, 1, 1, 0}));
}

TEST_F(PluginCasesTest, CaseCommandsGuardTheData)
{
    auto failingOne = std::make_shared<FailingUpdateDatabase>(path("db"));
    m_plugin->setCaseDatabase(failingOne);
    const int caseId =
        caseIdOf(call(CMD_ADD_CASE_WITH_RECORDINGS,
                      batch("c", {item("c1", false, 1000), item("c2", false, 2000), item("c3", false)})));
    QList<int> ids = vault().getCaseItemIdSet(caseId).values();
    std::sort(ids.begin(), ids.end());
    ASSERT_EQ(ids.size(), 3);
    EXPECT_EQ(call(CMD_UPDATE_CASE, QVariantMap{{KEY_CASE_ID, 9999}}).code, RC_CASE_NOT_FOUND);
    failingOne->failing = {-1}; // a handler that throws still answers, once
    EXPECT_EQ(summary(send(CMD_GET_CASE_LIST, QVariant())), answered(RC_FAILURE));
    EXPECT_EQ(summary(send(CMD_DELETE_CASE, 9999)), answered(RC_CASE_NOT_FOUND));

    // One failing item update: partial failure, and that item goes with the one not listed.
    failingOne->failing = {ids[1]};
    QVariantMap keep = item("c1", false, 1000), fail = item("c2", false, 2000);
    keep.insert({{KEY_ID, ids[0]}, {KEY_COMMENT, QStringLiteral("kept")}});
    fail.insert(KEY_ID, ids[1]);
    const Reply updated = call(CMD_UPDATE_CASE, QVariantMap{{KEY_CASE_ID, caseId},
                                                            {KEY_CASE_NAME, QStringLiteral("renamed")},
                                                            {KEY_CASE_ITEM, QVariantList{keep, fail}}});
    EXPECT_EQ(updated.code + updated.payload.toMap().value(KEY_CASE_NAME).toString(),
              RC_PARTIAL_FAILURE + "renamed");
    EXPECT_EQ(failingOne->getCaseItemIdSet(caseId), QSet<int>{ids[0]});
    EXPECT_EQ(failingOne->getCaseItemInfoMap(ids[0]).value(KEY_COMMENT), "kept");

    // An empty item list empties the case and still succeeds.
    EXPECT_EQ(call(CMD_UPDATE_CASE, QVariantMap{{KEY_CASE_ID, caseId}}).code, RC_SUCCESS);
    EXPECT_TRUE(vault().getCaseItemIdSet(caseId).isEmpty());
    EXPECT_EQ(summary(send(CMD_DELETE_CASE, caseId)),
              "1 1 " + RC_SUCCESS.toStdString() + " '' [" + std::to_string(caseId) + "]");
    EXPECT_TRUE(call(CMD_GET_CASE_LIST, QVariant()).payload.toList().isEmpty() &&
                vault().getAllCase().isEmpty());
}

// Two clients rewrite one case's items at once: the case holds one client's list whole.
TEST_F(PluginCasesTest, ConcurrentUpdatesOfOneCaseKeepOneListWhole)
{
    for (int round = 0; round < 20; ++round) {
        const int caseId = caseIdOf(call(CMD_ADD_CASE_WITH_RECORDINGS,
                                         batch("c", {item("a", false), item("b", false), item("c", false)})));
        QList<int> ids = vault().getCaseItemIdSet(caseId).values();
        std::sort(ids.begin(), ids.end());
        std::vector<std::thread> threads;
        for (const QString client : {"1", "2"}) {
            threads.emplace_back([&, client] {
                QVariantList list;
                for (int i : {0, 1}) {
                    list << QVariantMap{{KEY_ID, ids[i]}, {KEY_NODE_ID, "n"}, {KEY_COMMENT, client}};
                }
                ReplyRecorder recorder;
                m_plugin->Request(CMD_UPDATE_CASE, QVariantMap{{KEY_CASE_ID, caseId}, {KEY_CASE_ITEM, list}},
                                  m_sender, recorder.callback());
                recorder.waitFinal();
            });
        }
        for (std::thread& thread : threads) {
            thread.join();
        }
        QStringList comments;
        for (const QVariant& element : vault().getCaseItemList(caseId)) {
            comments << element.toMap().value(KEY_COMMENT).toString();
        }
        EXPECT_TRUE(comments == QStringList({"1", "1"}) || comments == QStringList({"2", "2"}))
            << qPrintable(comments.join(','));
    }
}

TEST_F(PluginCasesTest, ConcurrentCaseCommandsSurviveAPathChange)
{
    constexpr int kThreads = 4, kCasesPerThread = 15;
    std::vector<ReplyRecorder> recorders(kThreads * kCasesPerThread);
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t]() {
            for (int n = t * kCasesPerThread; n < (t + 1) * kCasesPerThread; ++n) {
                m_plugin->Request(CMD_ADD_CASE_WITH_ITEM, single(QString::number(n), item("c", false)),
                                  m_sender, recorders[n].callback());
                ReplyRecorder list;
                m_plugin->Request(CMD_GET_CASE_LIST, QVariant(), m_sender, list.callback());
            }
        });
    }
    // The path changes while the commands run; the host delivers the signal on this thread.
    m_serverInfo.setServerDatabasePath(path("db2"));
    for (std::thread& thread : threads) {
        thread.join();
    }
    // Every case is acknowledged once and is in one of the two vaults, with its item.
    ASSERT_TRUE(waitFor([&] {
        return std::all_of(recorders.begin(), recorders.end(),
                           [](const ReplyRecorder& r) { return r.finalCount(); });
    }));
    for (ReplyRecorder& recorder : recorders) {
        EXPECT_EQ(QStringLiteral("%1 %2").arg(recorder.finalCount()).arg(recorder.last().code),
                  "1 " + RC_SUCCESS);
    }
    EXPECT_EQ(itemCounts("db") + itemCounts("db2"), QList<int>(kThreads * kCasesPerThread, 1));
}

// The file-size limit stays in a second process of this program: it runs the disabled test below.
TEST(PluginCasesFullVault, CommandsAnswerFailureNeverSuccessAndEarlierCasesSurvive)
{
    runDisabledTestInChild("PluginCasesTest.DISABLED_FullVaultFolderInThisProcess");
}

TEST_F(PluginCasesTest, DISABLED_FullVaultFolderInThisProcess)
{
    // Items are told apart by their start; big images make every few of them need a new page.
    qint64 nextStart = 1700000000000;
    QSet<int> acknowledgedCases;
    QSet<qint64> acknowledgedItems, storedStarts;
    // Adds one item to case `caseId`, or with a new case for 0; says whether it was acknowledged.
    auto add = [&](int caseId) {
        QVariantMap entry = item(QStringLiteral("cam1"), false, nextStart += 1000);
        entry.insert({{KEY_OBJ_IMAGE, QString(3000, QLatin1Char('i'))}, {KEY_CASE_ID, caseId}});
        const Reply reply = caseId ? call(CMD_ADD_CASE_ITEM, entry)
                                   : call(CMD_ADD_CASE_WITH_ITEM, QVariantMap{{KEY_CASE_ITEM, entry}});
        if (reply.code == RC_SUCCESS) {
            acknowledgedCases.insert(caseId ? caseId : caseIdOf(reply));
            acknowledgedItems.insert(nextStart);
        }
        return reply.code == RC_SUCCESS;
    };
    ASSERT_TRUE(add(0) && add(0) && add(0));
    const int firstCase = *std::min_element(acknowledgedCases.begin(), acknowledgedCases.end());
    int refused = 0;
    {
        // Full: the vault file may not grow.
        FileSizeLimit full(QFileInfo(path("db") + QStringLiteral("/PluginDelvix/CaseVault.db")).size());
        for (int round = 0; round < 40; ++round) {
            refused += (add(0) ? 0 : 1) + (add(firstCase) ? 0 : 1);
            EXPECT_GE(call(CMD_GET_CASE_LIST, QVariant()).payload.toList().size(), 3); // reads keep answering
        }
        EXPECT_EQ(call(CMD_RETRIEVE_CASE_ITEM_MODEL, firstCase).code, RC_SUCCESS);
    }
    EXPECT_GE(refused, 5) << "the limit refused nothing";
    EXPECT_TRUE(add(0)) << "writes did not resume";

    // A fresh instance holds every acknowledged case and item. A case answered failure went in
    // before its item was refused, and stays (as with any item failure) without it.
    CaseDatabase reopened = vault();
    for (const QVariant& record : reopened.getAllCase()) {
        const int caseId = record.toMap().value(KEY_CASE_ID).toInt();
        const QVariantList items = reopened.getCaseItemList(caseId);
        EXPECT_TRUE(acknowledgedCases.remove(caseId) || items.isEmpty()) << caseId;
        for (const QVariant& stored : items) {
            storedStarts.insert(stored.toMap().value(KEY_START_TIMESTAMP).toLongLong());
        }
    }
    EXPECT_TRUE(acknowledgedCases.isEmpty()) << "acknowledged cases are missing";
    EXPECT_EQ(acknowledgedItems - storedStarts, QSet<qint64>()) << "acknowledged items are missing";
}

#include "PluginDelvixSrvTest.moc"
