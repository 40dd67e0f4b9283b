// Fuzz target: the plug-in's request path. The input's first line is the command name, the rest
// a JSON text that becomes the parameters (any JSON value; a text that does not parse gives a
// null variant). One plug-in serves the process, with the host's real bookmark plug-ins (local
// and behind the relay path "east"), its server-information plug-in, a small store seeded once,
// a camera directory whose HTTP client refuses every exchange, and a fresh copy of a small case
// vault per input, so that an input does the same whenever it runs.
// Each request is answered finally at most once and nothing follows that answer; a search ends
// with its final answer, once stopped at the latest; an add batch that asked for bookmarks ends
// with its final answer. Anything else is a crash.
#include "AttributeQueryWorker.h"
#include "AttributeRetriever.h"
#include "BookmarkPlugin.h"
#include "CameraProxy.h"
#include "CameraSynchronizer.h"
#include "CaseDatabase.h"
#include "DelvixKeys.h"
#include "HostPluginManager.h"
#include "HostRelaySender.h"
#include "IBraskHTTPClient.h"
#include "IFrameworkTools.h"
#include "PluginDelvixSrv.h"
#include "PluginServerInfo.h"
#include "TamsaSeeder.h"
#include "TamsaWrapper.h"

#include <QCoreApplication>
#include <QDir>
#include <QElapsedTimer>
#include <QFile>
#include <QFileInfo>
#include <QJsonArray>
#include <QJsonDocument>
#include <QTemporaryDir>
#include <QTimer>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <mutex>

namespace {

constexpr int kAnswerWaitMs = 10000;

void check(bool condition, const char* what)
{
    if (!condition) {
        std::fprintf(stderr, "fuzz_request: %s\n", what);
        std::abort();
    }
}

// The answers to one request, from any thread. Outlives the iteration: late answers land here.
class Replies
{
public:
    HDLR_DO_REQUEST_CB callback(bool bSearch)
    {
        std::shared_ptr<State> state = m_state;
        return [state, bSearch](bool bFinal, const QString&, const QString&, const QVariant& payload) {
            std::lock_guard<std::mutex> lock(state->mutex);
            check(state->finals == 0, "an answer after the final one");
            if (bFinal) {
                ++state->finals;
            } else {
                ++state->progress;
                // A search's hit names its camera (empty when the directory has none).
                check(!bSearch || payload.toMap().contains(KEY_NODE_ID), "a hit without its camera");
            }
            state->changed.notify_all();
        };
    }
    // Runs the plug-in thread's queued work until the final answer or timeoutMs.
    bool waitFinal(int timeoutMs)
    {
        QElapsedTimer timer;
        timer.start();
        for (;;) {
            QCoreApplication::processEvents();
            std::unique_lock<std::mutex> lock(m_state->mutex);
            if (m_state->finals > 0) {
                return true;
            }
            if (timer.elapsed() >= timeoutMs) {
                return false;
            }
            m_state->changed.wait_for(lock, std::chrono::milliseconds(1));
        }
    }
    bool hasFinal() const
    {
        std::lock_guard<std::mutex> lock(m_state->mutex);
        return m_state->finals > 0;
    }
    int progress() const
    {
        std::lock_guard<std::mutex> lock(m_state->mutex);
        return m_state->progress;
    }

private:
    struct State
    {
        std::mutex mutex;
        std::condition_variable changed;
        int finals = 0;   // guarded by mutex
        int progress = 0; // guarded by mutex
    };
    std::shared_ptr<State> m_state = std::make_shared<State>();
};

class FuzzTools final : public IFrameworkTools
{
public:
    FuzzTools(IPluginManager* manager, IRelaySender* relay)
        : m_manager(manager)
        , m_relay(relay)
    {}
    IPluginManager* GetPluginManager() override { return m_manager; }
    INovirTunnelClient* GetNovirTunnelClient() override { return nullptr; }
    IRelaySender* GetRelaySender() override { return m_relay; }

private:
    IPluginManager* m_manager;
    IRelaySender* m_relay;
};

// No camera is reached: every exchange is refused, later, on the caller's thread.
class RefusingHttpClient final : public IBraskHTTPClient
{
public:
    bool Get(const QString&, const QString&, quint16, bool, const QString&, const QString&,
             std::function<void(QNetworkReply::NetworkError, const QByteArray&, const QByteArray&, bool)>
                 completion,
             unsigned int, const QList<QString>&) override
    {
        QTimer::singleShot(0, QCoreApplication::instance(), [completion]() {
            completion(QNetworkReply::ConnectionRefusedError, QByteArray(), QByteArray(), false);
        });
        return true;
    }
};

class FixedStore final : public TamsaWrapper
{
public:
    explicit FixedStore(QString path)
        : m_path(std::move(path))
    {}
    QString getStoragesDBPath() override { return m_path; }

private:
    QString m_path;
};

QVariantMap caseItem(const QString& nodeId, int type, qint64 start, const QString& bookmarkId)
{
    QVariantMap item{{KEY_NODE_ID, nodeId},
                     {KEY_LOC_ID, QStringLiteral("Loc1")},
                     {KEY_START_TIMESTAMP, start},
                     {KEY_END_TIMESTAMP, start + 60000},
                     {KEY_CASE_ITEM_TYPE, type},
                     {KEY_OBJ_IMAGE, QStringLiteral("aW1n")},
                     {KEY_NEED_BOOKMARK, !bookmarkId.isEmpty()}};
    if (!bookmarkId.isEmpty()) {
        item.insert(KEY_BOOKMARK_ID, bookmarkId);
    }
    return item;
}

// Stores and vaults write through to their files on every change; a memory file system, where
// there is one, keeps an input at milliseconds rather than at the disk's sync time.
QString scratchFolder()
{
    const QFileInfo memory(QStringLiteral("/dev/shm"));
    return memory.isDir() && memory.isWritable() ? memory.filePath() : QDir::tempPath();
}

class Host
{
public:
    Host()
        : m_root(QDir(scratchFolder()).filePath(QStringLiteral("fuzz_request-XXXXXX")))
    {
        check(m_root.isValid(), "no temporary folder");
        QDir root(m_root.path());
        check(root.mkpath(QStringLiteral("db")) && root.mkpath(QStringLiteral("template")), "no folders");
        makeVaultTemplate();
        seedStore();

        m_serverInfo = std::make_unique<PluginServerInfo>(root.filePath(QStringLiteral("db")));
        m_manager.registerPluginObject(PLUGIN_ID_SERVER_INFO, m_serverInfo.get());
        m_relay.addRemoteServer(QStringLiteral("east"), &m_remoteManager);
        createBookmarks();

        auto worker = std::make_shared<AttributeQueryWorker>();
        worker->setTamsa(std::make_shared<FixedStore>(root.filePath(QStringLiteral("store"))));
        worker->setPeriods(2);
        auto retriever = QSharedPointer<AttributeRetriever>::create();
        retriever->setAttributeRetriever(worker);
        auto synchronizer = QSharedPointer<CameraSynchronizer>::create(
            std::make_shared<CameraProxy>(std::make_shared<RefusingHttpClient>()));
        synchronizer->updateInformation(QVariantMap{
            {QStringLiteral("cam1"), QVariantMap{{QStringLiteral("Name"), QStringLiteral("cam1")},
                                                 {QStringLiteral("IP"), QStringLiteral("127.0.0.1")},
                                                 {QStringLiteral("Port"), 8080},
                                                 {QStringLiteral("UseSSL"), false},
                                                 {QStringLiteral("User"), QStringLiteral("admin")},
                                                 {QStringLiteral("Password"), QStringLiteral("cGFzcw==")},
                                                 {QStringLiteral("DelvixProtect"), false}}}});
        m_plugin = std::make_unique<PluginDelvixSrv>();
        m_plugin->setAttributeRetriever(retriever);
        m_plugin->setCameraSynchronizer(synchronizer);
        m_plugin->InitialPluginBase(&m_tools);
        m_plugin->AllPluginLoaded();
        m_sender.senderHandle = &m_client;
    }

    QString folder() const { return m_root.path(); }

    void run(const QString& command, const QVariant& params)
    {
        freshVault();
        const int bookmarkRequests = m_bookmarks->requestCount() + m_remoteBookmarks->requestCount();
        const bool bSearch = command == CMD_START_SEARCH || command == CMD_START_REID_SEARCH;
        Replies replies;
        m_plugin->Request(command, params, m_sender, replies.callback(bSearch));
        QCoreApplication::processEvents();
        // The bookmark requests the input made are taken (and counted) before anything is judged.
        drain(m_bookmarks.get());
        drain(m_remoteBookmarks.get());
        if (bSearch && !replies.waitFinal(kAnswerWaitMs)) {
            m_plugin->Request(CMD_STOP_SEARCH, QVariant(), m_sender, HDLR_DO_REQUEST_CB());
            check(replies.waitFinal(kAnswerWaitMs), "a stopped search never gave its final answer");
        }
        if (bSearch && command == CMD_START_SEARCH) {
            check(replies.progress() <= AttributeQueryWorker::kMaxHits, "more hits than a search returns");
        }
        if (!replies.hasFinal() &&
            m_bookmarks->requestCount() + m_remoteBookmarks->requestCount() != bookmarkRequests) {
            check(replies.waitFinal(kAnswerWaitMs), "an add batch never gave its final answer");
        }
        // Refused camera exchanges and other queued work of this input run now, not in the next.
        for (int i = 0; i < 3; ++i) {
            QCoreApplication::processEvents();
        }
        clearBookmarks(m_bookmarks.get());
        clearBookmarks(m_remoteBookmarks.get());
    }

private:
    QString vaultFile(const QString& folder) const
    {
        return QDir(m_root.filePath(folder)).filePath(QStringLiteral("PluginDelvix/CaseVault.db"));
    }

    // Case 1 with a local and a relayed bookmarked item and a type-1 item; case 2 empty.
    void makeVaultTemplate()
    {
        CaseDatabase vault(m_root.filePath(QStringLiteral("template")));
        const int robbery =
            vault.addCase(QStringLiteral("Robbery"), QStringLiteral("12345678"), QStringLiteral("Ann"));
        check(robbery == 1, "template case");
        check(vault.addCaseItem(robbery,
                                caseItem(QStringLiteral("cam1"), 0, 1700000000000, QStringLiteral("b1"))) > 0,
              "template item");
        check(vault.addCaseItem(
                  robbery, caseItem(QStringLiteral("east/cam2"), 0, 1700000100000, QStringLiteral("b2"))) > 0,
              "template item");
        check(vault.addCaseItem(robbery, caseItem(QStringLiteral("cam3"), 1, 1700000200000, QString())) > 0,
              "template item");
        check(vault.addCase(QStringLiteral("Empty"), QStringLiteral("87654321"), QStringLiteral("Bo")) == 2,
              "template case");
    }

    void freshVault()
    {
        m_plugin->setCaseDatabase(nullptr);
        QDir vault(m_root.filePath(QStringLiteral("vault")));
        vault.removeRecursively();
        check(vault.mkpath(QStringLiteral("PluginDelvix")), "vault folder");
        check(QFile::copy(vaultFile(QStringLiteral("template")), vaultFile(QStringLiteral("vault"))),
              "vault copy");
        m_plugin->setCaseDatabase(std::make_shared<CaseDatabase>(vault.path()));
    }

    // Three locations of people and vehicles with vectors, plates and thumbnails.
    void seedStore()
    {
        tamsa::TamsaSeedOptions options;
        options.objects = 90;
        options.locations = 3;
        options.seed = 5;
        options.spanSeconds = 3600;
        options.batchSize = 30;
        void* database = nullptr;
        const QByteArray record = TamsaWrapper::initRecord();
        check(Tamsa_InitDatabase(&database, record.constData(), 0) == TAMSA_OK, "store handle");
        check(Tamsa_SetStoragesDBPath(
                  database, m_root.filePath(QStringLiteral("store")).toUtf8().constData()) == TAMSA_OK,
              "store folder");
        check(tamsa::TamsaSeeder(options).seed(database).status == 0, "store seed");
        Tamsa_ReleaseDatabase(&database);
    }

    void createBookmarks()
    {
        const QDir root(m_root.path());
        m_bookmarks = std::make_unique<BookmarkPlugin>(root.filePath(QStringLiteral("bookmarks.json")));
        m_remoteBookmarks = std::make_unique<BookmarkPlugin>(root.filePath(QStringLiteral("remote.json")));
        m_manager.registerPluginObject(PLUGIN_ID_BOOKMARK, m_bookmarks.get());
        m_remoteManager.registerPluginObject(PLUGIN_ID_BOOKMARK, m_remoteBookmarks.get());
    }

    // Removes what an input stored, on the plug-in's own thread and after everything the input
    // queued there: the next input starts from no bookmarks. Cheaper than new plug-ins, and no
    // thread comes or goes while the sanitizer looks for leaks.
    static void clearBookmarks(BookmarkPlugin* plugin)
    {
        const HDLR_DO_REQUEST_CB ignore = [](bool, const QString&, const QString&, const QVariant&) {};
        for (const QString& id : plugin->bookmarks().keys()) {
            const QVariant request = QVariantMap{{KEY_BM_BOOKMARK_ID, id}};
            QMetaObject::invokeMethod(plugin, "DeleteBookmark", Qt::BlockingQueuedConnection,
                                      Q_ARG(QVariant, request), Q_ARG(RequestSenderInfo, RequestSenderInfo()),
                                      Q_ARG(HDLR_DO_REQUEST_CB, ignore));
        }
        check(plugin->bookmarks().isEmpty(), "bookmarks left behind");
    }

    // Returns once the plug-in's thread has run everything queued to it so far.
    static void drain(BookmarkPlugin* plugin)
    {
        QMetaObject::invokeMethod(
            plugin, []() {}, Qt::BlockingQueuedConnection);
    }

    QTemporaryDir m_root;
    std::unique_ptr<PluginServerInfo> m_serverInfo;
    std::unique_ptr<BookmarkPlugin> m_bookmarks;
    std::unique_ptr<BookmarkPlugin> m_remoteBookmarks;
    HostPluginManager m_manager;
    HostPluginManager m_remoteManager;
    HostRelaySender m_relay;
    FuzzTools m_tools{&m_manager, &m_relay};
    std::unique_ptr<PluginDelvixSrv> m_plugin;
    int m_client = 0;
    RequestSenderInfo m_sender;
};

// Any JSON value: a document, or else a single value such as a number or a text.
QVariant parseParams(const QByteArray& json)
{
    const QJsonDocument document = QJsonDocument::fromJson(json);
    if (!document.isNull()) {
        return document.toVariant();
    }
    const QJsonDocument wrapped = QJsonDocument::fromJson('[' + json + ']');
    if (wrapped.isArray() && wrapped.array().size() == 1) {
        return wrapped.array().at(0).toVariant();
    }
    return QVariant();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static int argc = 1;
    static char name[] = "fuzz";
    static char* argv[] = {name, nullptr};
    static QCoreApplication* app = QCoreApplication::instance() ? nullptr : new QCoreApplication(argc, argv);
    (void)app;
    static Host* host = new Host;
    // Taken down at exit, before the libraries' own statics: the plug-in joins its search thread
    // (a finished one is only joined by the next search or by the plug-in going away) and the
    // folders go with the host.
    static const int removal = std::atexit([]() {
        const QString folder = host->folder();
        delete host;
        QDir(folder).removeRecursively();
    });
    (void)removal;

    const QByteArray input = QByteArray::fromRawData(reinterpret_cast<const char*>(data), qsizetype(size));
    const qsizetype newline = input.indexOf('\n');
    const QString command = QString::fromUtf8(newline < 0 ? input : input.left(newline));
    const QVariant params = parseParams(newline < 0 ? QByteArray() : input.mid(newline + 1));
    host->run(command, params);
    return 0;
}
