#include "PluginDelvixSrv.h"

#include "CameraInformationCollector.h"
#include "DelvixKeys.h"
#include "LogFacility.h"
#include "ScopeTracer.h"

#include <QMetaObject>
#include <QRandomGenerator64>
#include <algorithm>
#include <exception>
#include <mutex>

namespace {

struct CommandEntry
{
    const QString& strCommand;
    PluginDelvixSrv::CommandHandler handler;
};

// State of one add batch, shared by its per-item callbacks and released with the last of them.
struct AddBatch
{
    std::mutex mutex;
    int completed = 0;       // guarded by mutex: items whose answer has arrived
    QList<QVariant> results; // guarded by mutex: item maps that may be stored, in answer order
    int total = 0;
    HDLR_DO_REQUEST_CB reply;
};

// One item's answer, shared by the copies of its callback. An item whose callback is released
// without ever being called (a bookmark plug-in or relay that dropped the request) counts as a
// failed bookmark, so that its batch still ends.
struct ItemAnswer
{
    std::atomic<bool> answered{false};
    std::function<void(bool bOk, const QVariantMap& result)> finish;
    ~ItemAnswer()
    {
        if (!answered.exchange(true)) {
            finish(false, QVariantMap());
        }
    }
};

} // namespace

// An add batch that has not given its final reply yet. Whoever sets answered first gives it:
// the batch's final step, or the destructor when the plug-in goes first.
struct PluginDelvixSrv::OpenBatch
{
    std::atomic<bool> answered{false};
    HDLR_DO_REQUEST_CB client;
};

// The reply callback of an add batch. It carries the vault the batch's case lives in, so the
// final step writes the items where their case is even when the path changed meanwhile, and
// the batch's open entry, so that the batch is answered exactly once.
struct PluginDelvixSrv::BatchReply
{
    HDLR_DO_REQUEST_CB client;
    std::shared_ptr<CaseDatabase> pCaseDatabase;
    std::shared_ptr<OpenBatch> pOpen;
    void operator()(bool bFinal, const QString& strCode, const QString& strMessage,
                    const QVariant& payload) const
    {
        if (client) {
            client(bFinal, strCode, strMessage, payload);
        }
    }
};

PluginDelvixSrv::PluginDelvixSrv()
    : IPluginObjectBase(nullptr)
    , m_pLifeGuard(std::make_shared<LifeGuard>())
{
    // Queued add-batch answers carry these types; unregistered, the final step would never run.
    registerHostMetaTypes();
    qRegisterMetaType<QList<QVariant>>("QList<QVariant>");
    m_pLifeGuard->pPlugin = this;
}

PluginDelvixSrv::~PluginDelvixSrv()
{
    {
        // The pair covers this object's own work; what its components log while they are
        // released below comes after the leave line.
        DELVIX_SCOPE_TRACE("PluginDelvixSrv::~PluginDelvixSrv");
        {
            // Late bookmark answers find the guard empty and leave this object alone.
            std::lock_guard<std::mutex> lock(m_pLifeGuard->mutex);
            m_pLifeGuard->pPlugin = nullptr;
        }
        // Batches still waiting for bookmarks get their final answer now, and store nothing.
        std::vector<std::shared_ptr<OpenBatch>> openBatches;
        {
            std::lock_guard<std::mutex> lock(m_openBatchesMutex);
            openBatches.swap(m_openBatches);
        }
        for (const std::shared_ptr<OpenBatch>& pOpen : openBatches) {
            if (!pOpen->answered.exchange(true)) {
                reply(pOpen->client, RC_FAILURE, QVariant());
            }
        }
    }
    setCaseDatabase(nullptr);
    // The retriever goes before the collector: its running search still looks up cameras
    // through the relay until the retriever has stopped it and waited for its thread.
    m_pAttributeRetriever.reset();
    m_pCameraInformationCollector.reset();
    m_cameraSynchronizer.reset();
}

void PluginDelvixSrv::setCameraSynchronizer(QSharedPointer<CameraSynchronizer> pCameraSynchronizer)
{
    m_cameraSynchronizer = std::move(pCameraSynchronizer);
}

void PluginDelvixSrv::setAttributeRetriever(QSharedPointer<AttributeRetriever> pAttributeRetriever)
{
    m_pAttributeRetriever = std::move(pAttributeRetriever);
}

void PluginDelvixSrv::setCameraInformationCollector(
    QSharedPointer<ICameraInformationCollector> pCameraInformationCollector)
{
    m_pCameraInformationCollector = std::move(pCameraInformationCollector);
}

bool PluginDelvixSrv::InitialPluginBase(IFrameworkTools* pTools)
{
    DELVIX_SCOPE_TRACE("PluginDelvixSrv::InitialPluginBase");
    if (!m_cameraSynchronizer) {
        m_cameraSynchronizer = QSharedPointer<CameraSynchronizer>(new CameraSynchronizer());
    }
    if (!m_pCameraInformationCollector) {
        m_pCameraInformationCollector =
            QSharedPointer<ICameraInformationCollector>(new CameraInformationCollector(pTools));
    }
    if (!m_pAttributeRetriever) {
        m_pAttributeRetriever = QSharedPointer<AttributeRetriever>::create();
    }
    if (pTools) {
        m_pPluginManager = pTools->GetPluginManager();
        m_pRelaySender = pTools->GetRelaySender();
    }
    ConnectSignal();
    return true;
}

void PluginDelvixSrv::ConnectSignal()
{
    notifyCameraInfoToSynchronizer();
    forwardReceiveRespData();
    connect(this, &PluginDelvixSrv::addBookmarkResponse, this, &PluginDelvixSrv::addCaseItem);
}

void PluginDelvixSrv::notifyCameraInfoToSynchronizer()
{
    if (!m_pCameraInformationCollector || !m_cameraSynchronizer) {
        return;
    }
    // Direct: the directory emits on the plug-in's thread, which is the synchroniser's. The
    // synchroniser is the receiver, so the connections end with whichever of the two goes first.
    ICameraInformationCollector* collector = m_pCameraInformationCollector.data();
    CameraSynchronizer* synchronizer = m_cameraSynchronizer.data();
    connect(collector, &ICameraInformationCollector::cameraInformationChanged, synchronizer,
            &CameraSynchronizer::updateInformation, Qt::DirectConnection);
    connect(collector, &ICameraInformationCollector::locationRemoved, synchronizer,
            &CameraSynchronizer::removeCameraLastSync, Qt::DirectConnection);
    connect(collector, &ICameraInformationCollector::cameraDisconnected, synchronizer,
            &CameraSynchronizer::removeCameraLastSync, Qt::DirectConnection);
}

void PluginDelvixSrv::forwardReceiveRespData()
{
    if (!m_cameraSynchronizer) {
        return;
    }
    connect(
        m_cameraSynchronizer.data(), &CameraSynchronizer::receiveResponseData, m_cameraSynchronizer.data(),
        [this](const QVariantMap& cameraInfo, uint time, const QVariantMap& data) {
            handleReceiveCameraResponseData(cameraInfo, time, data);
        },
        Qt::DirectConnection);
}

void PluginDelvixSrv::handleReceiveCameraResponseData(const QVariantMap& cameraInfo, uint,
                                                      const QVariantMap& data) const
{
    if (data.value(QStringLiteral("count")).toInt() <= 0 || !m_pCameraInformationCollector) {
        return;
    }
    const int group = cameraInfo.value(QStringLiteral("GroupID")).toInt();
    QString location = cameraInfo.value(QStringLiteral("Location")).toString();
    location.remove(QStringLiteral("Loc"));
    m_pCameraInformationCollector->writeData(group, location.toInt(nullptr, 10),
                                             data.value(QStringLiteral("data")).toString());
}

void PluginDelvixSrv::AllPluginLoaded()
{
    if (!m_pPluginManager || !m_pPluginManager->ConnectPluginSignal(
                                 PLUGIN_ID_SERVER_INFO, "2serverDatabasePathChanged(const QString &)", this,
                                 "1onServerDatabasePathChanged(const QString &)", 0)) {
        DELVIX_LOG(LogFacility::LevelError,
                   "%s, ConnectPluginSignal serverDatabasePathChanged from PluginServerInfo failure",
                   "PluginDelvixSrv::AllPluginLoaded");
    }
    if (!caseDatabase()) {
        const QString path = getServerDatabasePath();
        if (path.isEmpty()) {
            DELVIX_LOG(LogFacility::LevelError,
                       "%s, server database path is empty, the case vault has no file",
                       "PluginDelvixSrv::AllPluginLoaded");
        }
        setCaseDatabase(std::make_shared<CaseDatabase>(path));
    }
}

QVariantMap PluginDelvixSrv::cameraDirectory() const
{
    return m_pCameraInformationCollector ? m_pCameraInformationCollector->property("cameraDirectory").toMap()
                                         : QVariantMap();
}

QString PluginDelvixSrv::getServerDatabasePath()
{
    QObject* pServerInfo =
        m_pPluginManager ? m_pPluginManager->GetPluginObject(PLUGIN_ID_SERVER_INFO) : nullptr;
    if (!pServerInfo) {
        DELVIX_LOG(LogFacility::LevelError, "%s, GetPluginObject failure",
                   "PluginDelvixSrv::getServerDatabasePath");
        return QString();
    }
    QString path;
    QMetaObject::invokeMethod(pServerInfo, "serverDatabasePath", Qt::DirectConnection,
                              Q_RETURN_ARG(QString, path));
    return path;
}

void PluginDelvixSrv::onServerDatabasePathChanged(const QString& path)
{
    // Built before the swap: commands keep using the old vault until the new one is ready.
    setCaseDatabase(std::make_shared<CaseDatabase>(path));
}

void PluginDelvixSrv::setCaseDatabase(std::shared_ptr<CaseDatabase> pCaseDatabase)
{
    std::shared_ptr<CaseDatabase> previous;
    {
        std::lock_guard<std::mutex> lock(m_caseDatabaseMutex);
        previous = std::move(m_pCaseDatabase);
        m_pCaseDatabase = std::move(pCaseDatabase);
    }
    // previous is released here, outside the lock; commands still using it hold their own copy.
}

std::shared_ptr<CaseDatabase> PluginDelvixSrv::caseDatabase() const
{
    std::lock_guard<std::mutex> lock(m_caseDatabaseMutex);
    return m_pCaseDatabase;
}

void PluginDelvixSrv::Request(const QString& strCommand, const QVariant& params,
                              const RequestSenderInfo& senderInfo, HDLR_DO_REQUEST_CB hdlrDoRequestCB)
{
    DELVIX_SCOPE_TRACE("PluginDelvixSrv::Request");

    // The command table: each command's handler is plugged in here and nowhere else. The
    // names are compared exactly, case included, in this order.
    static const CommandEntry commandTable[] = {
        {CMD_START_SEARCH, &PluginDelvixSrv::commandStartSearch},
        {CMD_STOP_SEARCH, &PluginDelvixSrv::commandStopSearch},
        {CMD_START_REID_SEARCH, &PluginDelvixSrv::commandStartReIdSearch},
        {CMD_STOP_REID_SEARCH, &PluginDelvixSrv::commandStopReIdSearch},
        {CMD_RETRIEVE_DELVIX_DATA, &PluginDelvixSrv::commandRetrieveDelvixData},
        {CMD_ADD_CASE_WITH_ITEM, &PluginDelvixSrv::commandAddCaseWithItem},
        {CMD_ADD_CASE_ITEM, &PluginDelvixSrv::commandAddCaseItem},
        {CMD_ADD_CASE_WITH_RECORDINGS, &PluginDelvixSrv::commandAddCaseWithRecordings},
        {CMD_ADD_CASE_ITEM_FROM_RECORDINGS, &PluginDelvixSrv::commandAddCaseItemFromRecordings},
        {CMD_UPDATE_CASE, &PluginDelvixSrv::commandUpdateCase},
        {CMD_DELETE_CASE, &PluginDelvixSrv::commandDeleteCase},
        {CMD_GET_CASE_LIST, &PluginDelvixSrv::commandGetCaseList},
        {CMD_RETRIEVE_CASE_MODEL, &PluginDelvixSrv::commandRetrieveCaseModel},
        {CMD_RETRIEVE_CASE_ITEM_MODEL, &PluginDelvixSrv::commandRetrieveCaseItemModel},
    };

    // Whether the handler sent its final reply, so that one that throws before it still answers.
    const auto answered = std::make_shared<std::atomic<bool>>(false);
    const HDLR_DO_REQUEST_CB tracked =
        hdlrDoRequestCB ? HDLR_DO_REQUEST_CB([answered, hdlrDoRequestCB](bool bFinal, const QString& strCode,
                                                                         const QString& strMessage,
                                                                         const QVariant& payload) {
            if (bFinal) {
                *answered = true;
            }
            hdlrDoRequestCB(bFinal, strCode, strMessage, payload);
        })
                        : HDLR_DO_REQUEST_CB();
    try {
        for (const CommandEntry& entry : commandTable) {
            if (strCommand == entry.strCommand) {
                (this->*entry.handler)(params, senderInfo, tracked);
                return;
            }
        }
        if (hdlrDoRequestCB) {
            hdlrDoRequestCB(true, RC_COMMAND_NOT_SUPPORTED, QString(), QVariant());
        }
        return;
    } catch (const std::exception& e) {
        // Nothing may escape into the host; a client not yet answered gets its final "-1".
        DELVIX_LOG(LogFacility::LevelError, "%s, %s failed: %s", "PluginDelvixSrv::Request",
                   qPrintable(strCommand), e.what());
    } catch (...) {
        DELVIX_LOG(LogFacility::LevelError, "%s, %s failed", "PluginDelvixSrv::Request",
                   qPrintable(strCommand));
    }
    if (hdlrDoRequestCB && !answered->exchange(true)) {
        hdlrDoRequestCB(true, RC_FAILURE, QString(), QVariant());
    }
}

void PluginDelvixSrv::RequestBlock(const QString&, const QVariant&, const RequestSenderInfo&, IResponser&)
{
    DELVIX_SCOPE_TRACE("PluginDelvixSrv::RequestBlock");
}

void PluginDelvixSrv::SubscribeEventBlock(const QString&, const QString&, const QVariant&,
                                          const RequestSenderInfo&, IResponser&)
{
    DELVIX_SCOPE_TRACE("PluginDelvixSrv::SubscribeEventBlock");
}

void PluginDelvixSrv::UnsubscribeEventBlock(const QString&, const QVariant&, IResponser&)
{
    DELVIX_SCOPE_TRACE("PluginDelvixSrv::UnsubscribeEventBlock");
}

void PluginDelvixSrv::setEnableDelvix(const QVariantMap& delvixSettings)
{
    m_bEnableDelvix = delvixSettings.value(QStringLiteral("enable")).toBool();
    if (m_cameraSynchronizer) {
        m_cameraSynchronizer->setEnableDelvix(delvixSettings);
    }
    if (m_pCameraInformationCollector) {
        m_pCameraInformationCollector->setDelvixSettings(delvixSettings);
    }
    const auto state = [&delvixSettings](const char* key) {
        return delvixSettings.value(QLatin1String(key)).toBool() ? "Enable" : "Disable";
    };
    DELVIX_LOG(LogFacility::LevelSetting, "%s Delvix, %s Face Delvix, %s LPR Delvix", state("enable"),
               state("faceEnable"), state("LPREnable"));
}

AttributeRetriever::Callback PluginDelvixSrv::makeResultRelay(const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    return [this, hdlrDoRequestCB](bool bFinished, const QVariantMap& record) {
        if (!hdlrDoRequestCB) {
            return;
        }
        // The host's callback must not unwind into the scheduler.
        try {
            if (bFinished) {
                hdlrDoRequestCB(true, RC_SUCCESS, QString(), QVariant());
                return;
            }
            QVariantMap hit = record;
            hit.insert(KEY_NODE_ID, cameraNodeID(hit.value(KEY_LOC_ID).toString()));
            hdlrDoRequestCB(false, RC_SUCCESS, QString(), hit);
        } catch (const std::exception& e) {
            DELVIX_LOG(LogFacility::LevelError, "%s, reply failed: %s", "PluginDelvixSrv::resultRelay",
                       e.what());
        } catch (...) {
            DELVIX_LOG(LogFacility::LevelError, "%s, reply failed", "PluginDelvixSrv::resultRelay");
        }
    };
}

QString PluginDelvixSrv::cameraNodeID(const QString& locationId) const
{
    // No camera directory yet: hits carry an empty camera.
    return m_pCameraInformationCollector ? m_pCameraInformationCollector->getCameraNodeID(locationId)
                                         : QString();
}

bool PluginDelvixSrv::searchesEnabled(const HDLR_DO_REQUEST_CB& hdlrDoRequestCB) const
{
    if (m_bEnableDelvix.load() && m_pAttributeRetriever) {
        return true;
    }
    // Switched off: the client gets the final reply at once and nothing is searched.
    reply(hdlrDoRequestCB, RC_SUCCESS, QVariant());
    return false;
}

void PluginDelvixSrv::commandStartSearch(const QVariant& params, const RequestSenderInfo& senderInfo,
                                         const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    if (searchesEnabled(hdlrDoRequestCB)) {
        m_pAttributeRetriever->query(senderInfo.senderHandle, params.toMap(),
                                     makeResultRelay(hdlrDoRequestCB));
    }
}

void PluginDelvixSrv::commandStopSearch(const QVariant&, const RequestSenderInfo& senderInfo,
                                        const HDLR_DO_REQUEST_CB&)
{
    if (m_pAttributeRetriever) {
        m_pAttributeRetriever->stop(senderInfo.senderHandle);
    }
}

void PluginDelvixSrv::commandStartReIdSearch(const QVariant& params, const RequestSenderInfo& senderInfo,
                                             const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    if (searchesEnabled(hdlrDoRequestCB)) {
        m_pAttributeRetriever->reId(senderInfo.senderHandle, params.toMap(),
                                    makeResultRelay(hdlrDoRequestCB));
    }
}

void PluginDelvixSrv::commandStopReIdSearch(const QVariant& params, const RequestSenderInfo& senderInfo,
                                            const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    // One stop serves both kinds: it ends whichever search the client is running.
    commandStopSearch(params, senderInfo, hdlrDoRequestCB);
}

void PluginDelvixSrv::commandRetrieveDelvixData(const QVariant& params, const RequestSenderInfo&,
                                                const HDLR_DO_REQUEST_CB&)
{
    // No reply: the camera's answer is handled like a routine window. The synchroniser carries
    // the call over to its own thread, where its maps and the HTTP client live.
    const QVariantMap request = params.toMap();
    if (m_cameraSynchronizer) {
        m_cameraSynchronizer->retrieveDelvixData(request.value(KEY_NODE_ID).toString(),
                                                 request.value(KEY_START_TIMESTAMP).toLongLong(),
                                                 request.value(KEY_END_TIMESTAMP).toLongLong());
    }
}

void PluginDelvixSrv::commandAddCaseWithItem(const QVariant& params, const RequestSenderInfo& senderInfo,
                                             const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    const std::shared_ptr<CaseDatabase> pCaseDatabase = caseDatabase();
    if (!pCaseDatabase) {
        replyNoCaseDatabase("addCaseWithItem", hdlrDoRequestCB);
        return;
    }
    const QVariantMap map = params.toMap();
    const int caseId = pCaseDatabase->addCase(map.value(KEY_CASE_NAME).toString(), generateCaseNumber(),
                                              map.value(KEY_REPORTER).toString());
    if (caseId <= 0) {
        reply(hdlrDoRequestCB, RC_FAILURE, QVariant());
        return;
    }
    QVariantMap item = map.value(KEY_CASE_ITEM).toMap();
    item.insert(KEY_CASE_ID, caseId);
    handleAddCaseItem(QList<QVariant>{item}, senderInfo, hdlrDoRequestCB, pCaseDatabase);
}

void PluginDelvixSrv::commandAddCaseItem(const QVariant& params, const RequestSenderInfo& senderInfo,
                                         const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    std::shared_ptr<CaseDatabase> pCaseDatabase = caseDatabase();
    if (!pCaseDatabase) {
        replyNoCaseDatabase("addCaseItem", hdlrDoRequestCB);
        return;
    }
    handleAddCaseItem(QList<QVariant>{params.toMap()}, senderInfo, hdlrDoRequestCB, std::move(pCaseDatabase));
}

void PluginDelvixSrv::commandAddCaseWithRecordings(const QVariant& params,
                                                   const RequestSenderInfo& senderInfo,
                                                   const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    const std::shared_ptr<CaseDatabase> pCaseDatabase = caseDatabase();
    if (!pCaseDatabase) {
        replyNoCaseDatabase("addCaseWithRecordings", hdlrDoRequestCB);
        return;
    }
    const QVariantMap map = params.toMap();
    const int caseId = pCaseDatabase->addCase(map.value(KEY_CASE_NAME).toString(), generateCaseNumber(),
                                              map.value(KEY_REPORTER).toString());
    if (caseId <= 0) {
        reply(hdlrDoRequestCB, RC_FAILURE, QVariant());
        return;
    }
    handleAddCaseItem(withCaseId(map.value(KEY_CASE_ITEM).toList(), caseId), senderInfo, hdlrDoRequestCB,
                      pCaseDatabase);
}

void PluginDelvixSrv::commandAddCaseItemFromRecordings(const QVariant& params,
                                                       const RequestSenderInfo& senderInfo,
                                                       const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    std::shared_ptr<CaseDatabase> pCaseDatabase = caseDatabase();
    if (!pCaseDatabase) {
        replyNoCaseDatabase("addCaseItemFromRecordings", hdlrDoRequestCB);
        return;
    }
    // The case is not checked here: the vault refuses items of a case it does not hold.
    const QVariantMap map = params.toMap();
    handleAddCaseItem(withCaseId(map.value(KEY_CASE_ITEM).toList(), map.value(KEY_CASE_ID).toInt()),
                      senderInfo, hdlrDoRequestCB);
}

void PluginDelvixSrv::commandUpdateCase(const QVariant& params, const RequestSenderInfo& senderInfo,
                                        const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    const std::shared_ptr<CaseDatabase> pCaseDatabase = caseDatabase();
    if (!pCaseDatabase) {
        replyNoCaseDatabase("updateCase", hdlrDoRequestCB);
        return;
    }
    const QVariantMap map = params.toMap();
    const int caseId = map.value(KEY_CASE_ID).toInt();
    QString code = RC_SUCCESS;
    QList<QVariant> removedItems;
    QVariantMap updated;
    {
        // Another update of this case must not fall between reading its items and deleting those
        // not listed: each would delete what the other kept.
        const auto sequence = pCaseDatabase->lockSequence();
        if (!pCaseDatabase->containCase(caseId)) {
            code = RC_CASE_NOT_FOUND;
        } else if (!pCaseDatabase->updateCase(caseId, map)) {
            code = RC_FAILURE;
        } else {
            QSet<int> keptIds;
            for (const QVariant& element : map.value(KEY_CASE_ITEM).toList()) {
                const QVariantMap item = element.toMap();
                const int itemId = item.value(KEY_ID).toInt();
                if (pCaseDatabase->updateCaseItem(itemId, item)) {
                    keptIds.insert(itemId);
                } else {
                    code = RC_PARTIAL_FAILURE;
                }
            }
            // Every stored item that the request did not keep goes, with its bookmark.
            QSet<int> removedIds = pCaseDatabase->getCaseItemIdSet(caseId);
            removedIds.subtract(keptIds);
            for (const int itemId : std::as_const(removedIds)) {
                removedItems.append(pCaseDatabase->getCaseItemInfoMap(itemId));
                pCaseDatabase->deleteCaseItem(itemId);
            }
            updated = pCaseDatabase->getCaseInfoMap(caseId);
        }
    }
    if (code == RC_CASE_NOT_FOUND || code == RC_FAILURE) {
        reply(hdlrDoRequestCB, code, QVariant());
        return;
    }
    handleDeleteCaseItemBookmark(removedItems, senderInfo);
    reply(hdlrDoRequestCB, code, QVariant(updated));
}

void PluginDelvixSrv::commandDeleteCase(const QVariant& params, const RequestSenderInfo& senderInfo,
                                        const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    const std::shared_ptr<CaseDatabase> pCaseDatabase = caseDatabase();
    if (!pCaseDatabase) {
        replyNoCaseDatabase("deleteCase", hdlrDoRequestCB);
        return;
    }
    const int caseId = params.toInt();
    QList<QVariant> items;
    bool bFound = false, bDeleted = false;
    {
        // Read before anything goes (the bookmarks of these items are removed afterwards), with
        // no item added in between.
        const auto sequence = pCaseDatabase->lockSequence();
        items = pCaseDatabase->getCaseItemList(caseId);
        bFound = pCaseDatabase->containCase(caseId);
        bDeleted = bFound && pCaseDatabase->deleteCase(caseId);
    }
    if (!bFound) {
        reply(hdlrDoRequestCB, RC_CASE_NOT_FOUND, QVariant());
        return;
    }
    if (bDeleted) {
        handleDeleteCaseItemBookmark(items, senderInfo);
        reply(hdlrDoRequestCB, RC_SUCCESS, QVariant(caseId));
    } else {
        reply(hdlrDoRequestCB, RC_FAILURE, QVariant(caseId));
    }
}

void PluginDelvixSrv::commandGetCaseList(const QVariant&, const RequestSenderInfo&,
                                         const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    const std::shared_ptr<CaseDatabase> pCaseDatabase = caseDatabase();
    if (!pCaseDatabase) {
        replyNoCaseDatabase("getCaseList", hdlrDoRequestCB);
        return;
    }
    reply(hdlrDoRequestCB, RC_SUCCESS, QVariant(pCaseDatabase->getCaseList()));
}

void PluginDelvixSrv::commandRetrieveCaseModel(const QVariant&, const RequestSenderInfo&,
                                               const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    const std::shared_ptr<CaseDatabase> pCaseDatabase = caseDatabase();
    if (!pCaseDatabase) {
        replyNoCaseDatabase("retrieveCaseModel", hdlrDoRequestCB);
        return;
    }
    QVariantList cases = pCaseDatabase->getAllCase();
    for (QVariant& element : cases) {
        QVariantMap record = element.toMap();
        const int caseId = record.value(KEY_CASE_ID).toInt();
        const std::pair<QString, QString> duration = pCaseDatabase->getCaseDuration(caseId);
        record.insert(KEY_START_TIMESTAMP, duration.first);
        record.insert(KEY_END_TIMESTAMP, duration.second);
        record.insert(KEY_COVER_IMAGE, QVariant(QStringList(pCaseDatabase->getCaseCoverImage(caseId))));
        element = record;
    }
    reply(hdlrDoRequestCB, RC_SUCCESS, QVariant(cases));
}

void PluginDelvixSrv::commandRetrieveCaseItemModel(const QVariant& params, const RequestSenderInfo&,
                                                   const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    const std::shared_ptr<CaseDatabase> pCaseDatabase = caseDatabase();
    if (!pCaseDatabase) {
        replyNoCaseDatabase("retrieveCaseItemModel", hdlrDoRequestCB);
        return;
    }
    const int caseId = params.toInt();
    QVariantMap model;
    model.insert(KEY_CASE_INFO_MAP, pCaseDatabase->getCaseInfoMap(caseId));
    model.insert(KEY_CASE_ITEM_LIST, pCaseDatabase->getCaseItemList(caseId));
    reply(hdlrDoRequestCB, RC_SUCCESS, QVariant(model));
}

void PluginDelvixSrv::reply(const HDLR_DO_REQUEST_CB& hdlrDoRequestCB, const QString& strCode,
                            const QVariant& payload)
{
    if (hdlrDoRequestCB) {
        hdlrDoRequestCB(true, strCode, QString(), payload);
    }
}

void PluginDelvixSrv::replyNoCaseDatabase(const char* strCommand, const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    DELVIX_LOG(LogFacility::LevelError, "%s, %s arrived before the case vault exists",
               "PluginDelvixSrv::Request", strCommand);
    reply(hdlrDoRequestCB, RC_FAILURE, QVariant());
}

QList<QVariant> PluginDelvixSrv::withCaseId(const QList<QVariant>& caseItemList, int caseId)
{
    QList<QVariant> items;
    items.reserve(caseItemList.size());
    for (const QVariant& element : caseItemList) {
        QVariantMap item = element.toMap();
        item.insert(KEY_CASE_ID, caseId);
        items.append(item);
    }
    return items;
}

QString PluginDelvixSrv::generateCaseNumber() const
{
    const quint64 draw = QRandomGenerator64::global()->generate() & 0xffffffffu;
    const quint64 scaled = (draw * 90000000u) >> 32;
    return QStringLiteral("%1").arg(scaled + 10000000u, 8, 10, QLatin1Char('0'));
}

void PluginDelvixSrv::handleAddCaseItem(const QList<QVariant>& caseItemList,
                                        const RequestSenderInfo& senderInfo,
                                        HDLR_DO_REQUEST_CB hdlrDoRequestCB)
{
    handleAddCaseItem(caseItemList, senderInfo, std::move(hdlrDoRequestCB), caseDatabase());
}

void PluginDelvixSrv::handleAddCaseItem(const QList<QVariant>& caseItemList,
                                        const RequestSenderInfo& senderInfo,
                                        HDLR_DO_REQUEST_CB hdlrDoRequestCB,
                                        std::shared_ptr<CaseDatabase> pCaseDatabase)
{
    if (caseItemList.isEmpty()) {
        return;
    }
    auto batch = std::make_shared<AddBatch>();
    batch->total = int(caseItemList.size());
    auto pOpen = std::make_shared<OpenBatch>();
    pOpen->client = hdlrDoRequestCB;
    {
        std::lock_guard<std::mutex> lock(m_openBatchesMutex);
        m_openBatches.push_back(pOpen);
    }
    batch->reply = BatchReply{std::move(hdlrDoRequestCB), std::move(pCaseDatabase), pOpen};
    const std::shared_ptr<LifeGuard> pLifeGuard = m_pLifeGuard;

    // Every reply of the batch goes out on the plug-in's thread, posted in order: a progress reply
    // can never follow the final one, not even at unload, when the posted ones are discarded with
    // the plug-in. The guard's lock is held only to post; the batch's lock only to count.
    auto finish = [pLifeGuard, batch, pOpen](bool bOk, const QVariantMap& result) {
        const auto post = [&pLifeGuard](auto step) {
            std::lock_guard<std::mutex> lifeLock(pLifeGuard->mutex);
            if (PluginDelvixSrv* pPlugin = pLifeGuard->pPlugin) {
                QMetaObject::invokeMethod(
                    pPlugin, [pPlugin, step] { step(pPlugin); }, Qt::QueuedConnection);
            }
        };
        const HDLR_DO_REQUEST_CB client = batch->reply;
        post([client, pOpen](PluginDelvixSrv*) {
            if (!pOpen->answered.load()) {
                client(false, RC_SUCCESS, QString(), QVariant());
            }
        });
        QList<QVariant> results;
        {
            std::lock_guard<std::mutex> lock(batch->mutex);
            if (bOk) {
                batch->results.append(result);
            }
            if (++batch->completed < batch->total) {
                return;
            }
            results = batch->results;
        }
        const QString code = results.size() == batch->total ? RC_SUCCESS : RC_FAILURE;
        post([code, results, client](PluginDelvixSrv* pPlugin) {
            emit pPlugin->addBookmarkResponse(code, results, client);
        });
    };

    for (const QVariant& element : caseItemList) {
        const QVariantMap item = element.toMap();
        const QString node = item.value(KEY_NODE_ID).toString();
        const QString relay = getRelayPath(node);
        const QString camera = getCameraId(node);

        // Counts the first answer of its item only: a bookmark plug-in that answers twice must
        // neither count twice nor end the batch a second time.
        auto pAnswer = std::make_shared<ItemAnswer>();
        pAnswer->finish = finish;
        HDLR_DO_REQUEST_CB itemCallback = [pAnswer, item, relay](bool, const QString& strCode, const QString&,
                                                                 const QVariant& payload) {
            if (pAnswer->answered.exchange(true)) {
                return;
            }
            if (strCode != RC_SUCCESS) {
                DELVIX_LOG(LogFacility::LevelError, "AddBookmark response failed: %s (%s)",
                           qPrintable(strCode), qPrintable(relay));
                pAnswer->finish(false, QVariantMap());
                return;
            }
            QVariantMap result = item;
            if (!result.contains(KEY_BOOKMARK_ID)) {
                result.insert(KEY_BOOKMARK_ID, payload.toMap().value(KEY_BM_BOOKMARK_ID).toString());
            }
            pAnswer->finish(true, result);
        };

        if (!item.value(KEY_NEED_BOOKMARK).toBool()) {
            itemCallback(true, RC_SUCCESS, QString(), QVariant());
            continue;
        }
        QVariantMap request;
        request.insert(KEY_BM_CAMERA_ID, camera);
        request.insert(KEY_BM_LOCATION_ID, item.value(KEY_LOC_ID));
        request.insert(KEY_BM_START_TIMESTAMP, item.value(KEY_START_TIMESTAMP));
        request.insert(KEY_BM_END_TIMESTAMP, item.value(KEY_END_TIMESTAMP));
        request.insert(KEY_BM_DESCRIPTION, QString());
        request.insert(KEY_BM_CREATOR, QStringLiteral("admin"));
        request.insert(KEY_BM_GROUP, QStringLiteral("CaseVault"));
        if (relay.isEmpty()) {
            addBookmark(request, senderInfo, itemCallback);
        } else {
            addSubstationBookmark(request, relay, itemCallback);
        }
    }
}

void PluginDelvixSrv::addCaseItem(const QString& returnCode, const QList<QVariant>& caseItemList,
                                  HDLR_DO_REQUEST_CB hdlrDoRequestCB) const
{
    const BatchReply* pBatchReply = hdlrDoRequestCB.target<BatchReply>();
    if (pBatchReply && pBatchReply->pOpen) {
        if (pBatchReply->pOpen->answered.exchange(true)) {
            return; // answered already, at shutdown
        }
        std::lock_guard<std::mutex> lock(m_openBatchesMutex);
        m_openBatches.erase(std::remove(m_openBatches.begin(), m_openBatches.end(), pBatchReply->pOpen),
                            m_openBatches.end());
    }
    if (caseItemList.isEmpty()) {
        reply(hdlrDoRequestCB, returnCode, QVariant());
        return;
    }
    // The vault the batch started on; a batch reply made elsewhere uses the current one.
    const std::shared_ptr<CaseDatabase> pCaseDatabase =
        pBatchReply && pBatchReply->pCaseDatabase ? pBatchReply->pCaseDatabase : caseDatabase();
    if (!pCaseDatabase) {
        replyNoCaseDatabase("addCaseItem", hdlrDoRequestCB);
        return;
    }
    QString code = returnCode;
    int caseId = 0;
    for (const QVariant& element : caseItemList) {
        const QVariantMap item = element.toMap();
        caseId = item.value(KEY_CASE_ID).toInt();
        if (pCaseDatabase->addCaseItem(caseId, item) < 1) {
            code = RC_FAILURE;
        }
    }
    reply(hdlrDoRequestCB, code, QVariant(pCaseDatabase->getCaseInfoMap(caseId)));
}

QString PluginDelvixSrv::getRelayPath(const QString& strNodeId)
{
    if (!strNodeId.contains(QLatin1Char('/'))) {
        return QString();
    }
    return strNodeId.split(QLatin1Char('/')).at(0);
}

QString PluginDelvixSrv::getCameraId(const QString& strNodeId)
{
    if (!strNodeId.contains(QLatin1Char('/'))) {
        return strNodeId;
    }
    return strNodeId.split(QLatin1Char('/')).at(1);
}

void PluginDelvixSrv::addBookmark(const QVariantMap& request, const RequestSenderInfo& senderInfo,
                                  const HDLR_DO_REQUEST_CB& hdlrDoRequestCB) const
{
    QObject* pBookmark = m_pPluginManager ? m_pPluginManager->GetPluginObject(PLUGIN_ID_BOOKMARK) : nullptr;
    if (!pBookmark) {
        DELVIX_LOG(LogFacility::LevelError, "%s, Load bookmarkPlugin failed", "PluginDelvixSrv::addBookmark");
        reply(hdlrDoRequestCB, RC_FAILURE, QVariant());
        return;
    }
    if (!QMetaObject::invokeMethod(pBookmark, "AddBookmark", Qt::AutoConnection,
                                   Q_ARG(QVariant, QVariant(request)), Q_ARG(RequestSenderInfo, senderInfo),
                                   Q_ARG(HDLR_DO_REQUEST_CB, hdlrDoRequestCB))) {
        DELVIX_LOG(LogFacility::LevelError, "InvokeMethod AddBookmark failed");
        reply(hdlrDoRequestCB, RC_FAILURE, QVariant());
    }
}

void PluginDelvixSrv::deleteBookmark(QVariantMap request, const RequestSenderInfo& senderInfo,
                                     HDLR_DO_REQUEST_CB hdlrDoRequestCB)
{
    QObject* pBookmark = m_pPluginManager ? m_pPluginManager->GetPluginObject(PLUGIN_ID_BOOKMARK) : nullptr;
    if (!pBookmark) {
        DELVIX_LOG(LogFacility::LevelError, "%s, Load bookmarkPlugin failed",
                   "PluginDelvixSrv::deleteBookmark");
        reply(hdlrDoRequestCB, RC_FAILURE, QVariant());
        return;
    }
    if (!QMetaObject::invokeMethod(pBookmark, "DeleteBookmark", Qt::AutoConnection,
                                   Q_ARG(QVariant, QVariant(request)), Q_ARG(RequestSenderInfo, senderInfo),
                                   Q_ARG(HDLR_DO_REQUEST_CB, hdlrDoRequestCB))) {
        // Nobody is answered, but a bookmark left behind must at least be visible in the log.
        DELVIX_LOG(LogFacility::LevelError, "InvokeMethod DeleteBookmark failed");
    }
}

void PluginDelvixSrv::addSubstationBookmark(const QVariantMap& request, const QString& strRelayPath,
                                            const HDLR_DO_REQUEST_CB& hdlrDoRequestCB) const
{
    const bool bSent =
        m_pRelaySender &&
        m_pRelaySender->RelayRequest(PLUGIN_ID_BOOKMARK, QStringLiteral("AddBookmark"), QVariant(request),
                                     false, strRelayPath, relayResponse(hdlrDoRequestCB));
    if (!bSent) {
        DELVIX_LOG(LogFacility::LevelError, "Send RelayRequest AddBookmark failed: %s",
                   qPrintable(strRelayPath));
        reply(hdlrDoRequestCB, RC_FAILURE, QVariant());
    }
}

void PluginDelvixSrv::deleteSubstationBookmark(const QVariantMap& request, const QString& strRelayPath,
                                               const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    const bool bSent =
        m_pRelaySender &&
        m_pRelaySender->RelayRequest(PLUGIN_ID_BOOKMARK, QStringLiteral("DeleteBookmark"), QVariant(request),
                                     false, strRelayPath, relayResponse(hdlrDoRequestCB));
    if (!bSent) {
        DELVIX_LOG(LogFacility::LevelError, "Send RelayRequest DeleteBookmark failed: %s",
                   qPrintable(strRelayPath));
    }
}

HDLR_RELAY_RESPONSE_CB PluginDelvixSrv::relayResponse(const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    // The remote code is not passed on: anything but success is a failure here.
    return [hdlrDoRequestCB](bool, QVariant result, QString strReturnCode, QString, bool) {
        if (strReturnCode == RC_SUCCESS) {
            reply(hdlrDoRequestCB, RC_SUCCESS, result);
        } else {
            reply(hdlrDoRequestCB, RC_FAILURE, QVariant());
        }
    };
}

void PluginDelvixSrv::handleDeleteCaseItemBookmark(const QList<QVariant>& caseItemList,
                                                   const RequestSenderInfo& senderInfo)
{
    for (const QVariant& element : caseItemList) {
        const QVariantMap item = element.toMap();
        const QString bookmark = item.value(KEY_BOOKMARK_ID).toString();
        if (bookmark.isEmpty()) {
            continue;
        }
        const QString node = item.value(KEY_NODE_ID).toString();
        const QString relay = getRelayPath(node);
        HDLR_DO_REQUEST_CB callback = [node, bookmark](bool, const QString& strCode, const QString&,
                                                       const QVariant&) {
            if (strCode != RC_SUCCESS) {
                DELVIX_LOG(LogFacility::LevelError,
                           "%s, delete case item bookmark failed, nodeID: %s, bookmarkID: %s",
                           "PluginDelvixSrv::handleDeleteCaseItemBookmark::<lambda_1>::operator ()",
                           qPrintable(node), qPrintable(bookmark));
            }
        };
        const QVariantMap request{{KEY_BM_BOOKMARK_ID, bookmark}};
        if (relay.isEmpty()) {
            deleteBookmark(request, senderInfo, callback);
        } else {
            deleteSubstationBookmark(request, relay, callback);
        }
    }
}
