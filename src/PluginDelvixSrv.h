#pragma once
// The plug-in object the host loads. It takes every client request through Request, which
// dispatches by command name to one handler per command; the handlers answer through the
// reply callback of the request, now or later and from any thread.

#include "AttributeRetriever.h"
#include "CameraSynchronizer.h"
#include "CaseDatabase.h"
#include "HostCallbacks.h"
#include "ICameraInformationCollector.h"
#include "IFrameworkTools.h"
#include "IPluginManager.h"
#include "IPluginObjectBase.h"
#include "IRelaySender.h"

#include <QMutex>
#include <QObject>
#include <QSharedPointer>
#include <QString>
#include <QVariant>
#include <atomic>
#include <memory>
#include <mutex>
#include <vector>

class PluginDelvixSrv : public IPluginObjectBase
{
    Q_OBJECT
    Q_PLUGIN_METADATA(IID "com.Quorvex.PluginServer.PluginInterface" FILE "PluginDelvixSrv.json")
    Q_INTERFACES(IPluginObjectBase)

public:
    PluginDelvixSrv();
    ~PluginDelvixSrv() override;

    bool InitialPluginBase(IFrameworkTools* pTools) override;
    void Request(const QString& strCommand, const QVariant& params, const RequestSenderInfo& senderInfo,
                 HDLR_DO_REQUEST_CB hdlrDoRequestCB) override;
    void RequestBlock(const QString& strCommand, const QVariant& params, const RequestSenderInfo& senderInfo,
                      IResponser& responser) override;
    void SubscribeEventBlock(const QString& strEvent, const QString& strFilter, const QVariant& params,
                             const RequestSenderInfo& senderInfo, IResponser& responser) override;
    void UnsubscribeEventBlock(const QString& strEvent, const QVariant& params,
                               IResponser& responser) override;
    void AllPluginLoaded() override;

    // Components installed before InitialPluginBase stay; it creates only the missing ones.
    // Install them before requests arrive: request and search threads read them unguarded.
    void setCameraSynchronizer(QSharedPointer<CameraSynchronizer> pCameraSynchronizer);
    void setAttributeRetriever(QSharedPointer<AttributeRetriever> pAttributeRetriever);
    void
    setCameraInformationCollector(QSharedPointer<ICameraInformationCollector> pCameraInformationCollector);

    // Replaces the case vault; the previous one goes when the last command using it ends.
    void setCaseDatabase(std::shared_ptr<CaseDatabase> pCaseDatabase);
    // The server database path from the server-information plug-in; a null text without it.
    QString getServerDatabasePath();
    // The camera directory as last announced, for the development host's diagnostics.
    Q_INVOKABLE QVariantMap cameraDirectory() const;

    // Adds case items as one batch: each item that asks for a bookmark waits for it, then the
    // items that may be stored are written and the final reply carries the case detail. One
    // progress reply per item comes first. An empty list sends no reply at all.
    void handleAddCaseItem(const QList<QVariant>& caseItemList, const RequestSenderInfo& senderInfo,
                           HDLR_DO_REQUEST_CB hdlrDoRequestCB);
    // Eight decimal digits, 10000000 to 99999999; not checked for uniqueness.
    QString generateCaseNumber() const;

    // Node identifier "relay/camera" or "camera": the relay path (empty for a local camera)
    // and the camera identifier.
    static QString getRelayPath(const QString& strNodeId);
    static QString getCameraId(const QString& strNodeId);
    // Bookmarks on this server's bookmark plug-in or, through the relay, on another server's.
    // Each answers through the callback; the add operations answer "-1" themselves when the
    // request cannot be made.
    void addBookmark(const QVariantMap& request, const RequestSenderInfo& senderInfo,
                     const HDLR_DO_REQUEST_CB& hdlrDoRequestCB) const;
    void deleteBookmark(QVariantMap request, const RequestSenderInfo& senderInfo,
                        HDLR_DO_REQUEST_CB hdlrDoRequestCB);
    void addSubstationBookmark(const QVariantMap& request, const QString& strRelayPath,
                               const HDLR_DO_REQUEST_CB& hdlrDoRequestCB) const;
    void deleteSubstationBookmark(const QVariantMap& request, const QString& strRelayPath,
                                  const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    // Removes the bookmarks of deleted case items in the background; failures are logged.
    void handleDeleteCaseItemBookmark(const QList<QVariant>& caseItemList,
                                      const RequestSenderInfo& senderInfo);

signals:
    void addBookmarkResponse(const QString& returnCode, const QList<QVariant>& caseItemList,
                             HDLR_DO_REQUEST_CB hdlrDoRequestCB);

public slots:
    void onServerDatabasePathChanged(const QString& path);
    // Hands a camera's fetched metadata that holds objects to the camera directory's writeData.
    void handleReceiveCameraResponseData(const QVariantMap& cameraInfo, uint time,
                                         const QVariantMap& data) const;
    // Takes the delvix settings ("enable", "faceEnable", "LPREnable"): "enable" gates the
    // two start commands; the camera directory gets the whole map.
    void setEnableDelvix(const QVariantMap& delvixSettings);

private slots:
    // Final step of an add batch, on the plug-in's thread: stores the items and replies.
    void addCaseItem(const QString& returnCode, const QList<QVariant>& caseItemList,
                     HDLR_DO_REQUEST_CB hdlrDoRequestCB) const;

public:
    // One handler per command of the dispatch table.
    using CommandHandler = void (PluginDelvixSrv::*)(const QVariant& params,
                                                     const RequestSenderInfo& senderInfo,
                                                     const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);

private:
    // Command handlers, in the order of the dispatch table (PluginDelvixSrv.cpp).
    void commandStartSearch(const QVariant& params, const RequestSenderInfo& senderInfo,
                            const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandStopSearch(const QVariant& params, const RequestSenderInfo& senderInfo,
                           const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandStartReIdSearch(const QVariant& params, const RequestSenderInfo& senderInfo,
                                const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandStopReIdSearch(const QVariant& params, const RequestSenderInfo& senderInfo,
                               const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandRetrieveDelvixData(const QVariant& params, const RequestSenderInfo& senderInfo,
                                   const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandAddCaseWithItem(const QVariant& params, const RequestSenderInfo& senderInfo,
                                const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandAddCaseItem(const QVariant& params, const RequestSenderInfo& senderInfo,
                            const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandAddCaseWithRecordings(const QVariant& params, const RequestSenderInfo& senderInfo,
                                      const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandAddCaseItemFromRecordings(const QVariant& params, const RequestSenderInfo& senderInfo,
                                          const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandUpdateCase(const QVariant& params, const RequestSenderInfo& senderInfo,
                           const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandDeleteCase(const QVariant& params, const RequestSenderInfo& senderInfo,
                           const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandGetCaseList(const QVariant& params, const RequestSenderInfo& senderInfo,
                            const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandRetrieveCaseModel(const QVariant& params, const RequestSenderInfo& senderInfo,
                                  const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    void commandRetrieveCaseItemModel(const QVariant& params, const RequestSenderInfo& senderInfo,
                                      const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);

    // Turns a search's (finished, record) stream into replies: one non-final reply per hit,
    // with the camera of its location under "nodeID", then the final reply. Called from the
    // scheduler thread, or from several re-identification threads at once.
    AttributeRetriever::Callback makeResultRelay(const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    QString cameraNodeID(const QString& locationId) const;
    // True when a start command may search; otherwise answers the final reply itself.
    bool searchesEnabled(const HDLR_DO_REQUEST_CB& hdlrDoRequestCB) const;

    void ConnectSignal();
    // Directory changes reach the synchroniser; its fetched metadata reaches the directory.
    void notifyCameraInfoToSynchronizer();
    void forwardReceiveRespData();
    // The case vault for one command or batch step: a copy of the member taken under its lock,
    // so a path change cannot free the vault under a running command. Null before
    // AllPluginLoaded; the caller then answers "-1".
    std::shared_ptr<CaseDatabase> caseDatabase() const;

    // The batch on a given vault: the items are stored in the vault their case was made in.
    void handleAddCaseItem(const QList<QVariant>& caseItemList, const RequestSenderInfo& senderInfo,
                           HDLR_DO_REQUEST_CB hdlrDoRequestCB, std::shared_ptr<CaseDatabase> pCaseDatabase);
    static void reply(const HDLR_DO_REQUEST_CB& hdlrDoRequestCB, const QString& strCode,
                      const QVariant& payload);
    static void replyNoCaseDatabase(const char* strCommand, const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    static QList<QVariant> withCaseId(const QList<QVariant>& caseItemList, int caseId);
    static HDLR_RELAY_RESPONSE_CB relayResponse(const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);

    // Created and used on the plug-in's thread; request threads only hand work over to it.
    QSharedPointer<CameraSynchronizer> m_cameraSynchronizer;
    QSharedPointer<AttributeRetriever> m_pAttributeRetriever;
    QSharedPointer<ICameraInformationCollector> m_pCameraInformationCollector;
    IPluginManager* m_pPluginManager = nullptr; // host object, not owned
    IRelaySender* m_pRelaySender = nullptr;     // host object, not owned
    struct OpenBatch;
    struct BatchReply;
    mutable std::mutex m_openBatchesMutex;                         // guards m_openBatches
    mutable std::vector<std::shared_ptr<OpenBatch>> m_openBatches; // batches without their final reply

    // Lets answers that arrive on other threads after destruction find that the plug-in is gone.
    struct LifeGuard
    {
        std::mutex mutex; // held to post to the plug-in, and to clear pPlugin
        // Null once destruction began. Atomic too: ThreadSanitizer reported the destructor's write
        // against a late answer's read under this lock (only after other tests in the process).
        std::atomic<PluginDelvixSrv*> pPlugin{nullptr};
    };
    std::shared_ptr<LifeGuard> m_pLifeGuard;
    // std::mutex rather than QMutex, here and in the vault: ThreadSanitizer sees its locking.
    mutable std::mutex m_caseDatabaseMutex;        // guards m_pCaseDatabase
    std::shared_ptr<CaseDatabase> m_pCaseDatabase; // guarded by m_caseDatabaseMutex
    // Gates the two start commands; written by the settings slot, read on request threads.
    std::atomic<bool> m_bEnableDelvix{true};
};
