#include "PluginDelvixSrv.h"

#include "DelvixKeys.h"
#include "LogFacility.h"
#include "ScopeTracer.h"

#include <exception>

namespace {

struct CommandEntry
{
    const QString& strCommand;
    PluginDelvixSrv::CommandHandler handler;
};

} // namespace

PluginDelvixSrv::PluginDelvixSrv()
    : IPluginObjectBase(nullptr)
{
    registerHostMetaTypes();
}

PluginDelvixSrv::~PluginDelvixSrv()
{
    DELVIX_SCOPE_TRACE("PluginDelvixSrv::~PluginDelvixSrv");
    // The retriever goes before the collector: its running search still looks up cameras
    // through the relay until the retriever has stopped it and waited for its thread.
    m_pAttributeRetriever.reset();
    m_pCameraInformationCollector.reset();
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
    if (!m_pAttributeRetriever) {
        m_pAttributeRetriever = QSharedPointer<AttributeRetriever>::create();
    }
    if (pTools) {
        m_pPluginManager = pTools->GetPluginManager();
        m_pRelaySender = pTools->GetRelaySender();
    }
    return true;
}

void PluginDelvixSrv::AllPluginLoaded()
{
    DELVIX_SCOPE_TRACE("PluginDelvixSrv::AllPluginLoaded");
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

    try {
        for (const CommandEntry& entry : commandTable) {
            if (strCommand == entry.strCommand) {
                (this->*entry.handler)(params, senderInfo, hdlrDoRequestCB);
                return;
            }
        }
        if (hdlrDoRequestCB) {
            hdlrDoRequestCB(true, RC_COMMAND_NOT_SUPPORTED, QString(), QVariant());
        }
    } catch (const std::exception& e) {
        // Nothing may escape into the host. The handler may already have answered, so the
        // failure is only logged.
        DELVIX_LOG(LogFacility::LevelError, "%s, %s failed: %s", "PluginDelvixSrv::Request",
                   qPrintable(strCommand), e.what());
    } catch (...) {
        DELVIX_LOG(LogFacility::LevelError, "%s, %s failed", "PluginDelvixSrv::Request",
                   qPrintable(strCommand));
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

void PluginDelvixSrv::replyNotAvailable(const char* strCommand,
                                        const HDLR_DO_REQUEST_CB& hdlrDoRequestCB) const
{
    DELVIX_LOG(LogFacility::LevelError, "%s, command %s is not available yet", "PluginDelvixSrv::Request",
               strCommand);
    if (hdlrDoRequestCB) {
        hdlrDoRequestCB(true, RC_FAILURE, QString(), QVariant());
    }
}

void PluginDelvixSrv::setEnableDelvix(const QVariantMap& delvixSettings)
{
    m_bEnableDelvix = delvixSettings.value(QStringLiteral("enable")).toBool();
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

void PluginDelvixSrv::commandStartSearch(const QVariant& params, const RequestSenderInfo& senderInfo,
                                         const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    if (!m_bEnableDelvix.load() || !m_pAttributeRetriever) {
        if (hdlrDoRequestCB) {
            hdlrDoRequestCB(true, RC_SUCCESS, QString(), QVariant());
        }
        return;
    }
    m_pAttributeRetriever->query(senderInfo.senderHandle, params.toMap(), makeResultRelay(hdlrDoRequestCB));
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
    if (!m_bEnableDelvix.load() || !m_pAttributeRetriever) {
        if (hdlrDoRequestCB) {
            hdlrDoRequestCB(true, RC_SUCCESS, QString(), QVariant());
        }
        return;
    }
    m_pAttributeRetriever->reId(senderInfo.senderHandle, params.toMap(), makeResultRelay(hdlrDoRequestCB));
}

void PluginDelvixSrv::commandStopReIdSearch(const QVariant&, const RequestSenderInfo& senderInfo,
                                            const HDLR_DO_REQUEST_CB&)
{
    if (m_pAttributeRetriever) {
        m_pAttributeRetriever->stop(senderInfo.senderHandle);
    }
}

void PluginDelvixSrv::commandRetrieveDelvixData(const QVariant&, const RequestSenderInfo&,
                                                const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    replyNotAvailable("retrieveDelvixData", hdlrDoRequestCB);
}

void PluginDelvixSrv::commandAddCaseWithItem(const QVariant&, const RequestSenderInfo&,
                                             const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    replyNotAvailable("addCaseWithItem", hdlrDoRequestCB);
}

void PluginDelvixSrv::commandAddCaseItem(const QVariant&, const RequestSenderInfo&,
                                         const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    replyNotAvailable("addCaseItem", hdlrDoRequestCB);
}

void PluginDelvixSrv::commandAddCaseWithRecordings(const QVariant&, const RequestSenderInfo&,
                                                   const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    replyNotAvailable("addCaseWithRecordings", hdlrDoRequestCB);
}

void PluginDelvixSrv::commandAddCaseItemFromRecordings(const QVariant&, const RequestSenderInfo&,
                                                       const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    replyNotAvailable("addCaseItemFromRecordings", hdlrDoRequestCB);
}

void PluginDelvixSrv::commandUpdateCase(const QVariant&, const RequestSenderInfo&,
                                        const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    replyNotAvailable("updateCase", hdlrDoRequestCB);
}

void PluginDelvixSrv::commandDeleteCase(const QVariant&, const RequestSenderInfo&,
                                        const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    replyNotAvailable("deleteCase", hdlrDoRequestCB);
}

void PluginDelvixSrv::commandGetCaseList(const QVariant&, const RequestSenderInfo&,
                                         const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    replyNotAvailable("getCaseList", hdlrDoRequestCB);
}

void PluginDelvixSrv::commandRetrieveCaseModel(const QVariant&, const RequestSenderInfo&,
                                               const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    replyNotAvailable("retrieveCaseModel", hdlrDoRequestCB);
}

void PluginDelvixSrv::commandRetrieveCaseItemModel(const QVariant&, const RequestSenderInfo&,
                                                   const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    replyNotAvailable("retrieveCaseItemModel", hdlrDoRequestCB);
}
