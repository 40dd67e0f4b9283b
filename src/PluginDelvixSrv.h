#pragma once
// The plug-in object the host loads. It takes every client request through Request, which
// dispatches by command name to one handler per command; the handlers answer through the
// reply callback of the request, now or later and from any thread.

#include "AttributeRetriever.h"
#include "HostCallbacks.h"
#include "ICameraInformationCollector.h"
#include "IFrameworkTools.h"
#include "IPluginManager.h"
#include "IPluginObjectBase.h"
#include "IRelaySender.h"

#include <QObject>
#include <QSharedPointer>
#include <QString>
#include <QVariant>
#include <atomic>

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
    void setAttributeRetriever(QSharedPointer<AttributeRetriever> pAttributeRetriever);
    void
    setCameraInformationCollector(QSharedPointer<ICameraInformationCollector> pCameraInformationCollector);

    // One handler per command of the dispatch table.
    using CommandHandler = void (PluginDelvixSrv::*)(const QVariant& params,
                                                     const RequestSenderInfo& senderInfo,
                                                     const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);

public slots:
    // Takes the delvix settings ("enable", "faceEnable", "LPREnable"): "enable" gates the
    // two start commands; the camera directory gets the whole map.
    void setEnableDelvix(const QVariantMap& delvixSettings);

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

    // Answer of a command whose handler is not built yet: (true, "-1", "", none), logged.
    void replyNotAvailable(const char* strCommand, const HDLR_DO_REQUEST_CB& hdlrDoRequestCB) const;

    QSharedPointer<AttributeRetriever> m_pAttributeRetriever;
    QSharedPointer<ICameraInformationCollector> m_pCameraInformationCollector;
    IPluginManager* m_pPluginManager = nullptr; // host object, not owned
    IRelaySender* m_pRelaySender = nullptr;     // host object, not owned
    // Gates the two start commands; written by the settings slot, read on request threads.
    std::atomic<bool> m_bEnableDelvix{true};
};
