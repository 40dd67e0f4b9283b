#include "NOVIRSrvTunnelControl.h"

#include "DelvixKeys.h"
#include "LogFacility.h"

#include <exception>

namespace {

// The plug-in's identifier towards the tunnel client (the PluginID of its metadata).
const QString kPluginId = QStringLiteral("d2792a6a286548ecb47417172e5e5fa7");
const QString kRetCodeSuccess = QStringLiteral("0");

// Answer failure rule: success false alone is not a failure when the return code is "0".
bool isFailedPart(bool success, const QString& retCode)
{
    return !success && retCode != kRetCodeSuccess;
}

// A converted element value where a text is expected. An absent element stays an invalid
// value; an element that came with children or repeated (never so in a sound answer) becomes
// empty text, so that no record carries a foreign tree.
QVariant textValue(const QVariant& value)
{
    if (!value.isValid() || value.typeId() == QMetaType::QString) {
        return value;
    }
    return QVariant(QString());
}

// Camera names and the server id go into XML commands; escaping keeps them text.
QString escapeXmlText(const QString& text)
{
    QString escaped = text;
    escaped.replace(QLatin1Char('&'), QLatin1String("&amp;"));
    escaped.replace(QLatin1Char('<'), QLatin1String("&lt;"));
    escaped.replace(QLatin1Char('>'), QLatin1String("&gt;"));
    return escaped;
}

} // namespace

template <typename Function>
void NOVIRSrvTunnelControl::callGuarded(const std::shared_ptr<CallbackGuard>& guard, Function&& function)
{
    QReadLocker locker(&guard->lock);
    if (!guard->m_pReceiver) {
        return; // the tunnel control is gone; the client still holds this callback
    }
    try {
        function(guard->m_pReceiver);
    } catch (const std::exception& e) {
        DELVIX_LOG(LogFacility::LevelError, "%s, callback failed: %s", "NOVIRSrvTunnelControl::callGuarded",
                   e.what());
    } catch (...) {
        DELVIX_LOG(LogFacility::LevelError, "%s, callback failed", "NOVIRSrvTunnelControl::callGuarded");
    }
}

NOVIRSrvTunnelControl::NOVIRSrvTunnelControl(INovirTunnelClient* client)
    : NOVIRSrvTunnelControl(client, {})
{}

NOVIRSrvTunnelControl::NOVIRSrvTunnelControl(
    INovirTunnelClient* client, const std::function<void(NOVIRSrvTunnelControl*)>& connectSignals)
    : QObject(nullptr)
    , m_pNovirTunnelClient(client)
    , m_guard(std::make_shared<CallbackGuard>())
{
    m_guard->m_pReceiver = this;
    if (connectSignals) {
        connectSignals(this);
    }
    if (!m_pNovirTunnelClient) {
        return;
    }
    std::shared_ptr<CallbackGuard> guard = m_guard;
    m_pNovirTunnelClient->registerConnectStatusHandler(
        kPluginId, NSNovirTunnelClient::ConnectStatus,
        [guard](Qt::HANDLE clientID, NSNovirTunnelClient::ServerType type, bool connected) {
            callGuarded(guard, [&](NOVIRSrvTunnelControl* self) {
                self->hdlrConnectStatus(clientID, type, connected);
            });
        },
        QString());
}

NOVIRSrvTunnelControl::~NOVIRSrvTunnelControl()
{
    QWriteLocker locker(&m_guard->lock);
    m_guard->m_pReceiver = nullptr;
}

NSNovirTunnelClient::RequestInfo
NOVIRSrvTunnelControl::makeRequest(const QString& content, const QString& extra,
                                   NSNovirTunnelClient::ResponseCallback callback) const
{
    NSNovirTunnelClient::RequestInfo request;
    request.nPriority = 0;
    request.nTimeoutMs = 15000;
    request.strContent = content;
    request.strExtra = extra;
    request.respCB = std::move(callback);
    return request;
}

bool NOVIRSrvTunnelControl::sendRequest(void* clientID, const QString& cmdName, const QString& content,
                                        const QString& extra, void* context,
                                        NSNovirTunnelClient::ServerType type)
{
    if (!m_pNovirTunnelClient) {
        DELVIX_LOG(LogFacility::LevelError, "%s, m_pNovirTunnelClient is null",
                   "NOVIRSrvTunnelControl::sendRequest");
        return false;
    }
    std::shared_ptr<CallbackGuard> guard = m_guard;
    auto callback = [guard, context](bool success, const QString&, const QString& relayPath,
                                     const QString& retCode, const QString& answer, bool finish) {
        callGuarded(guard, [&](NOVIRSrvTunnelControl* self) {
            emit self->reqResp(success, finish, answer, relayPath, context, retCode);
        });
    };
    return m_pNovirTunnelClient->insertRequest(kPluginId, clientID, type, cmdName,
                                               makeRequest(content, extra, std::move(callback)));
}

void* NOVIRSrvTunnelControl::getServerAccountID() const
{
    if (!m_pNovirTunnelClient) {
        DELVIX_LOG(LogFacility::LevelError, "%s, m_pNovirTunnelClient is null",
                   "NOVIRSrvTunnelControl::getServerAccountID");
        return nullptr;
    }
    return m_pNovirTunnelClient->getServerAccountID();
}

bool NOVIRSrvTunnelControl::registerBroadcastHandler(void* clientID)
{
    if (!m_pNovirTunnelClient) {
        DELVIX_LOG(LogFacility::LevelError, "%s, m_pNovirTunnelClient is null",
                   "NOVIRSrvTunnelControl::registerBroadcastHandler");
        return false;
    }
    std::shared_ptr<CallbackGuard> guard = m_guard;
    auto handler = [guard](Qt::HANDLE id, const QString& name, NSNovirTunnelClient::ServerType type,
                           const QString& relayPath, const QString& message) {
        callGuarded(guard, [&](NOVIRSrvTunnelControl* self) {
            self->hdlrBroadcastResp(id, name, type, relayPath, message);
        });
    };
    for (const QString& name :
         {NOVIR_CAM_INS, NOVIR_CAM_RMV, NOVIR_CAM_INFO_CHANGE, NOVIR_CHANNEL_ADD, NOVIR_CHANNEL_RMV}) {
        m_pNovirTunnelClient->registerBroadcastHandler(kPluginId, clientID, NSNovirTunnelClient::ConfigServer,
                                                       name, handler, QString());
    }
    return true;
}

bool NOVIRSrvTunnelControl::registerEventHandler(void* clientID, const QString& eventName,
                                                 NSNovirTunnelClient::ServerType type)
{
    if (!m_pNovirTunnelClient) {
        DELVIX_LOG(LogFacility::LevelError, "%s, m_pNovirTunnelClient is null",
                   "NOVIRSrvTunnelControl::registerEventHandler");
        return false;
    }
    std::shared_ptr<CallbackGuard> guard = m_guard;
    m_pNovirTunnelClient->registerEventHandler(
        kPluginId, clientID, type, eventName,
        [guard](Qt::HANDLE id, const QString& sourceId, const QString& name,
                NSNovirTunnelClient::ServerType kind, const QString& relayPath, const QString& message) {
            callGuarded(guard, [&](NOVIRSrvTunnelControl* self) {
                self->hdlrEventTrigger(id, sourceId, name, kind, relayPath, message);
            });
        },
        QString());
    return true;
}

void NOVIRSrvTunnelControl::hdlrConnectStatus(Qt::HANDLE clientID, NSNovirTunnelClient::ServerType type,
                                              bool connected)
{
    if (!connected) {
        return; // what was announced stays as it is until the server is back
    }
    switch (type) {
    case NSNovirTunnelClient::ConfigServer:
        m_strServerId =
            m_pNovirTunnelClient
                ? m_pNovirTunnelClient->getServerInfo(clientID, NSNovirTunnelClient::kServerInfoServerId)
                      .toString()
                : QString();
        registerBroadcastHandler(clientID);
        sendGetAllCameraNodeInfo();
        subscribeCameraStatusEvent();
        break;
    case NSNovirTunnelClient::LocationServer:
        sendQueryAllLocations();
        break;
    default:
        break;
    }
}

void NOVIRSrvTunnelControl::sendGetAllCameraNodeInfo()
{
    if (!m_pNovirTunnelClient) {
        return;
    }
    // Every part of one answer is announced together with the parts before it: the receiver
    // replaces its camera map with each announcement, so a part alone would drop the cameras
    // of the earlier parts.
    auto received = std::make_shared<QVariantMap>();
    std::shared_ptr<CallbackGuard> guard = m_guard;
    auto callback = [guard, received](bool success, const QString& cmdName, const QString&,
                                      const QString& retCode, const QString& answer, bool) {
        callGuarded(guard, [&](NOVIRSrvTunnelControl* self) {
            if (isFailedPart(success, retCode)) {
                DELVIX_LOG(LogFacility::LevelError,
                           "sendGetAllCameraNodeInfo, Insert request (%s) failed: %s", qPrintable(cmdName),
                           qPrintable(retCode));
                return;
            }
            if (cmdName != NOVIR_GET_NODE_INFO) {
                return;
            }
            const QMap<QString, QVariant> cameras = self->parseNodeInfo(answer);
            received->insert(cameras);
            emit self->updateCameras(*received);
        });
    };
    m_pNovirTunnelClient->insertRequest(
        kPluginId, getServerAccountID(), NSNovirTunnelClient::ConfigServer, NOVIR_GET_NODE_INFO,
        makeRequest(NOVIR_GET_ALL_NODE_INFO_BODY, QString(), std::move(callback)));
}

void NOVIRSrvTunnelControl::sendGetCameraNodeInfo(const QString& cameraName)
{
    if (!m_pNovirTunnelClient) {
        return;
    }
    std::shared_ptr<CallbackGuard> guard = m_guard;
    auto callback = [guard](bool success, const QString& cmdName, const QString& relayPath,
                            const QString& retCode, const QString& answer, bool finish) {
        callGuarded(guard, [&](NOVIRSrvTunnelControl* self) {
            self->InsReqRespCB(success, cmdName, relayPath, retCode, answer, finish);
        });
    };
    m_pNovirTunnelClient->insertRequest(
        kPluginId, getServerAccountID(), NSNovirTunnelClient::ConfigServer, NOVIR_GET_NODE_INFO,
        makeRequest(NOVIR_GET_NODE_INFO_BODY.arg(escapeXmlText(cameraName)), QString(), std::move(callback)));
}

void NOVIRSrvTunnelControl::sendQueryAllLocations()
{
    if (!m_pNovirTunnelClient) {
        return;
    }
    m_locationsMap.clear();
    std::shared_ptr<CallbackGuard> guard = m_guard;
    auto callback = [guard](bool success, const QString& cmdName, const QString&, const QString& retCode,
                            const QString& answer, bool finish) {
        callGuarded(guard, [&](NOVIRSrvTunnelControl* self) {
            if (isFailedPart(success, retCode)) {
                DELVIX_LOG(LogFacility::LevelError, "sendQueryAllLocations, Insert request (%s) failed: %s",
                           qPrintable(cmdName), qPrintable(retCode));
                return;
            }
            if (cmdName != NOVIR_QRY_LOCS) {
                return;
            }
            self->m_locationsMap.insert(self->parseQueryLocations(answer));
            if (finish) {
                emit self->updateLocations(self->m_locationsMap);
            }
        });
    };
    m_pNovirTunnelClient->insertRequest(kPluginId, getServerAccountID(), NSNovirTunnelClient::LocationServer,
                                        NOVIR_QRY_LOCS,
                                        makeRequest(NOVIR_QRY_LOCS_BODY, QString(), std::move(callback)));
}

void NOVIRSrvTunnelControl::subscribeCameraStatusEvent()
{
    if (!m_pNovirTunnelClient) {
        return;
    }
    const QString content = NOVIR_SUB_CAM_STATUS_BODY.arg(escapeXmlText(m_strServerId));
    std::shared_ptr<CallbackGuard> guard = m_guard;
    auto callback = [guard](bool success, const QString& cmdName, const QString& relayPath,
                            const QString& retCode, const QString& answer, bool finish) {
        callGuarded(guard, [&](NOVIRSrvTunnelControl* self) {
            self->InsReqRespCB(success, cmdName, relayPath, retCode, answer, finish);
        });
    };
    auto eventHandler = [guard](Qt::HANDLE id, const QString& sourceId, const QString& name,
                                NSNovirTunnelClient::ServerType kind, const QString& relayPath,
                                const QString& message) {
        callGuarded(guard, [&](NOVIRSrvTunnelControl* self) {
            self->hdlrCameraStatusChanged(id, sourceId, name, kind, relayPath, message);
        });
    };
    const bool accepted = m_pNovirTunnelClient->insertSubscribeRequest(
        kPluginId, getServerAccountID(), NSNovirTunnelClient::ConfigServer, NOVIR_SUB_CAM_STATUS,
        makeRequest(content, QString(), std::move(callback)), m_strServerId, eventHandler);
    if (!accepted) {
        DELVIX_LOG(LogFacility::LevelError, "%s, Send request (%s) to config server fail: %s",
                   "NOVIRSrvTunnelControl::subscribeCameraStatusEvent", qPrintable(NOVIR_SUB_CAM_STATUS),
                   qPrintable(content));
    }
}

void NOVIRSrvTunnelControl::InsReqRespCB(bool success, const QString& cmdName, const QString&,
                                         const QString& retCode, const QString& transRespMsg, bool)
{
    if (isFailedPart(success, retCode)) {
        DELVIX_LOG(LogFacility::LevelError, "%s, Insert request (%s) failed: %s",
                   "NOVIRSrvTunnelControl::InsReqRespCB", qPrintable(cmdName), qPrintable(retCode));
        return;
    }
    if (cmdName != NOVIR_GET_NODE_INFO) {
        return;
    }
    const QMap<QString, QVariant> cameras = parseNodeInfo(transRespMsg);
    for (auto it = cameras.cbegin(); it != cameras.cend(); ++it) {
        emit updateCamera(it.key(), it.value().toMap());
    }
}

void NOVIRSrvTunnelControl::hdlrCameraStatusChanged(Qt::HANDLE, const QString& sourceId, const QString&,
                                                    NSNovirTunnelClient::ServerType, const QString& relayPath,
                                                    const QString& message)
{
    if (message.isEmpty()) {
        DELVIX_LOG(LogFacility::LevelError, "%s, event message is empty",
                   "NOVIRSrvTunnelControl::hdlrCameraStatusChanged");
        return;
    }
    if (!relayPath.isEmpty() || sourceId != m_strServerId) {
        return; // another server's cameras
    }
    const QVariant tree = m_quellon.parse(message);
    const QVariant cams =
        tree.toMap().value(QStringLiteral("CamStatus")).toMap().value(QStringLiteral("Cam"));
    for (const QVariant& entryValue : Quellon::transContentAsList(cams)) {
        const QVariantMap entry = entryValue.toMap();
        emit updateCameraStatus(entry.value(QStringLiteral("Name")).toString(),
                                entry.value(QStringLiteral("ConnState")).toString() ==
                                    QLatin1String("Connected"));
    }
}

void NOVIRSrvTunnelControl::hdlrBroadcastResp(Qt::HANDLE, const QString& name,
                                              NSNovirTunnelClient::ServerType, const QString& relayPath,
                                              const QString& message)
{
    if (!relayPath.isEmpty()) {
        return;
    }
    const QVariant tree = m_quellon.parse(message);
    if (!tree.isValid()) {
        return;
    }
    const QVariantMap messageMap = tree.toMap();
    if (name == NOVIR_CAM_INS) {
        sendGetCameraNodeInfo(messageMap.value(NOVIR_CAM_INS)
                                  .toMap()
                                  .value(QStringLiteral("Entry"))
                                  .toMap()
                                  .value(QStringLiteral("Name"))
                                  .toString());
    } else if (name == NOVIR_CAM_RMV) {
        // The message element is "CamRm", not the broadcast's name.
        emit removeCamera(
            messageMap.value(QStringLiteral("CamRm")).toMap().value(QStringLiteral("Name")).toString());
    } else if (name == NOVIR_CAM_INFO_CHANGE) {
        sendGetCameraNodeInfo(
            messageMap.value(NOVIR_CAM_INFO_CHANGE).toMap().value(QStringLiteral("Cam")).toString());
    } else if (name == NOVIR_CHANNEL_ADD) {
        const QVariantMap channel = messageMap.value(NOVIR_CHANNEL_ADD).toMap();
        QVariantMap location;
        location.insert(QStringLiteral("Location"), channel.value(QStringLiteral("Loc")).toString());
        location.insert(QStringLiteral("GroupID"), channel.value(QStringLiteral("GrpID")).toInt());
        location.insert(QStringLiteral("IsRecording"), true);
        emit addLocation(channel.value(QStringLiteral("CamName")).toString(), location);
    } else if (name == NOVIR_CHANNEL_RMV) {
        emit removeLocation(
            messageMap.value(NOVIR_CHANNEL_RMV).toMap().value(QStringLiteral("CamName")).toString());
    }
}

void NOVIRSrvTunnelControl::hdlrEventTrigger(Qt::HANDLE clientID, const QString&, const QString&,
                                             NSNovirTunnelClient::ServerType, const QString& relayPath,
                                             const QString& message)
{
    emit evtResp(clientID, relayPath, message);
}

void NOVIRSrvTunnelControl::hdlrReqResp(bool success, const QString&, const QString& relayPath,
                                        const QString& retCode, const QString& transRespMsg, bool finish,
                                        void*, void* context)
{
    emit reqResp(success, finish, transRespMsg, relayPath, context, retCode);
}

QMap<QString, QVariant> NOVIRSrvTunnelControl::parseNodeInfo(const QString& answer)
{
    QMap<QString, QVariant> cameras;
    const QVariant tree = m_quellon.parse(answer);
    if (!tree.isValid()) {
        return cameras;
    }
    const QVariant cams = tree.toMap()
                              .value(QStringLiteral("NodeInfo"))
                              .toMap()
                              .value(QStringLiteral("Cameras"))
                              .toMap()
                              .value(QStringLiteral("Cam"));
    for (const QVariant& entryValue : Quellon::transContentAsList(cams)) {
        const QVariantMap entry = entryValue.toMap();
        const auto recordCap = entry.constFind(QStringLiteral("ObjectMetaRecordCap"));
        if (recordCap == entry.cend() || !recordCap->toBool()) {
            continue; // the camera records no object metadata
        }
        const QString name = entry.value(QStringLiteral("Name")).toString();
        const bool useSsl = entry.value(QStringLiteral("UseSSL")).toBool();
        int port = entry.value(QStringLiteral("Port")).toInt();
        if (useSsl) {
            const auto httpsPort = entry.constFind(QStringLiteral("HTTPSPort"));
            port = httpsPort != entry.cend() ? httpsPort->toInt() : 443;
        }
        const auto protectCap = entry.constFind(QStringLiteral("ObjectMetaProtectCap"));
        const bool isProtected = protectCap != entry.cend() && protectCap->toBool();

        QVariantMap record;
        record.insert(QStringLiteral("Name"), name);
        record.insert(QStringLiteral("IP"), textValue(entry.value(QStringLiteral("IP"))));
        record.insert(QStringLiteral("Port"), port);
        record.insert(QStringLiteral("UseSSL"), useSsl);
        record.insert(QStringLiteral("User"), textValue(entry.value(QStringLiteral("User"))));
        record.insert(QStringLiteral("Password"), textValue(entry.value(QStringLiteral("Pwd"))));
        record.insert(QStringLiteral("DelvixProtect"), isProtected);
        const auto channelCount = entry.constFind(QStringLiteral("NCh"));
        if (channelCount != entry.cend() && channelCount->toInt() > 1) {
            // Computed wide: a hostile Channel of INT_MIN must not overflow.
            const qint64 channel = qint64(entry.value(QStringLiteral("Channel")).toInt()) - 1;
            record.insert(QStringLiteral("MultiChannelID"), int(channel < 0 ? 0 : channel));
        }
        cameras.insert(name, record);
    }
    return cameras;
}

QMap<QString, QVariant> NOVIRSrvTunnelControl::parseQueryLocations(const QString& answer)
{
    QMap<QString, QVariant> locations;
    const QVariant tree = m_quellon.parse(answer);
    if (!tree.isValid()) {
        return locations;
    }
    const QVariant lists =
        tree.toMap().value(QStringLiteral("LocRecs")).toMap().value(QStringLiteral("LocList"));
    for (const QVariant& listValue : Quellon::transContentAsList(lists)) {
        const QVariantMap locList = listValue.toMap();
        const QVariant live = textValue(locList.value(QStringLiteral("Live")));
        for (const QVariant& locValue : Quellon::transContentAsList(locList.value(QStringLiteral("Loc")))) {
            const QVariantMap loc = locValue.toMap();
            QVariantMap record;
            record.insert(QStringLiteral("Location"), textValue(loc.value(QStringLiteral("Name"))));
            record.insert(QStringLiteral("GroupID"), textValue(loc.value(QStringLiteral("GrpID"))));
            record.insert(QStringLiteral("IsRecording"), live);
            locations.insert(loc.value(QStringLiteral("Alias")).toString(), record);
        }
    }
    return locations;
}
