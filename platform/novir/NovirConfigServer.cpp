#include "NovirConfigServer.h"

#include "Quellon.h"
#include "Tamsa.h"

#include <QDir>
#include <QMutexLocker>

namespace {

const QString kGetNodeInfo = QStringLiteral("GetNodeInfo");
const QString kQryLocs = QStringLiteral("QryLocs");
const QString kSubCamStatus = QStringLiteral("SubCamStatus");
const QString kInputObjectMetaInfo = QStringLiteral("InputObjectMetaInfo");
const QString kCamStatus = QStringLiteral("CamStatus");
const QString kAllCameras = QStringLiteral("__allcams__");
const QString kOk = QStringLiteral("0");
const QString kFailed = QStringLiteral("-1");

// Size and layout fixed by the store: a 704-byte record that starts with its own size.
struct StoreInitRecord
{
    uint16_t wSize = 704;
    uint8_t reserved[702] = {};
};
static_assert(sizeof(StoreInitRecord) == 704, "store init record is 704 bytes");

QString rootText(const QVariant& tree, const QString& root, const char* child)
{
    return tree.toMap().value(root).toMap().value(QLatin1String(child)).toString();
}

} // namespace

NovirConfigServer::NovirConfigServer(const NovirSite& site, QObject* parent)
    : QObject(parent)
    , m_context(std::make_unique<QObject>())
    , m_strServerId(site.serverId)
    , m_partSize(qMax(1, site.partSize))
    , m_prettyXml(site.prettyXml)
{
    for (const NovirCamera& camera : site.cameras) {
        m_cameras.insert(camera.name, camera);
    }
    m_thread.setObjectName(QStringLiteral("NovirConfigServer"));
    m_context->moveToThread(&m_thread);
}

NovirConfigServer::~NovirConfigServer()
{
    m_thread.quit();
    m_thread.wait();
    m_context.reset(); // its thread has ended; work still queued is dropped
    Tamsa_ReleaseDatabase(&m_store);
}

bool NovirConfigServer::openStore(const QString& storageDir, QString* error)
{
    if (m_store) {
        *error = QStringLiteral("the store is already open");
        return false;
    }
    if (!QDir().mkpath(storageDir)) {
        *error = QStringLiteral("cannot create %1").arg(storageDir);
        return false;
    }
    StoreInitRecord init;
    int32_t status = Tamsa_InitDatabase(&m_store, &init, 0);
    if (status == TAMSA_OK) {
        status = Tamsa_SetStoragesDBPath(m_store, storageDir.toUtf8().constData());
    }
    if (status != TAMSA_OK) {
        Tamsa_ReleaseDatabase(&m_store);
        *error = QStringLiteral("the store refused %1 (status 0x%2)")
                     .arg(storageDir)
                     .arg(quint32(status), 8, 16, QLatin1Char('0'));
        return false;
    }
    return true;
}

void NovirConfigServer::start()
{
    if (!m_thread.isRunning()) {
        m_thread.start();
    }
    setServerConnected(NSNovirTunnelClient::ConfigServer, true);
    setServerConnected(NSNovirTunnelClient::LocationServer, true);
}

void NovirConfigServer::setServerConnected(NSNovirTunnelClient::ServerType type, bool connected)
{
    QList<NSNovirTunnelClient::ConnectStatusHandler> handlers;
    {
        QMutexLocker locker(&m_mutex);
        if (type == NSNovirTunnelClient::ConfigServer) {
            m_configConnected = connected;
        } else if (type == NSNovirTunnelClient::LocationServer) {
            m_locationConnected = connected;
        } else {
            return;
        }
        handlers = m_connectHandlers;
    }
    const Qt::HANDLE id = clientHandle(type);
    post([handlers, id, type, connected]() {
        for (const auto& handler : handlers) {
            handler(id, type, connected);
        }
    });
}

void NovirConfigServer::addCamera(const NovirCamera& camera)
{
    QString status;
    {
        QMutexLocker locker(&m_mutex);
        m_cameras.insert(camera.name, camera);
        status = NovirSite::cameraStatusXml({camera});
    }
    const QString name = NovirSite::escape(camera.name);
    post([this, camera, name, status]() {
        broadcast(QStringLiteral("CamIns"), QString(),
                  QStringLiteral("<CamIns><Entry><Name>%1</Name></Entry></CamIns>").arg(name));
        if (!camera.location.isEmpty()) {
            broadcast(
                QStringLiteral("ChannelAdd"), QString(),
                QStringLiteral("<ChannelAdd><CamName>%1</CamName><Loc>%2</Loc><GrpID>%3</GrpID></ChannelAdd>")
                    .arg(name, NovirSite::escape(camera.location), QString::number(camera.groupId)));
        }
        sendCameraStatus(site().serverId, QString(), status);
    });
}

void NovirConfigServer::changeCamera(const NovirCamera& camera)
{
    {
        QMutexLocker locker(&m_mutex);
        if (!m_cameras.contains(camera.name)) {
            return;
        }
        m_cameras.insert(camera.name, camera);
    }
    const QString message =
        QStringLiteral("<CamInfoChange><Cam>%1</Cam></CamInfoChange>").arg(NovirSite::escape(camera.name));
    post([this, message]() { broadcast(QStringLiteral("CamInfoChange"), QString(), message); });
}

void NovirConfigServer::removeCamera(const QString& name)
{
    {
        QMutexLocker locker(&m_mutex);
        if (m_cameras.remove(name) == 0) {
            return;
        }
    }
    const QString message = QStringLiteral("<CamRm><Name>%1</Name></CamRm>").arg(NovirSite::escape(name));
    post([this, message]() { broadcast(QStringLiteral("CamRmv"), QString(), message); });
}

void NovirConfigServer::setCameraOnline(const QString& name, bool online)
{
    QString status;
    QString serverId;
    {
        QMutexLocker locker(&m_mutex);
        auto it = m_cameras.find(name);
        if (it == m_cameras.end()) {
            return;
        }
        it->online = online;
        status = NovirSite::cameraStatusXml({*it});
        serverId = m_strServerId;
    }
    post([this, serverId, status]() { sendCameraStatus(serverId, QString(), status); });
}

void NovirConfigServer::addChannel(const QString& name, const QString& location, int groupId)
{
    {
        QMutexLocker locker(&m_mutex);
        auto it = m_cameras.find(name);
        if (it == m_cameras.end()) {
            return;
        }
        it->location = location;
        it->groupId = groupId;
        it->live = true;
    }
    const QString message =
        QStringLiteral("<ChannelAdd><CamName>%1</CamName><Loc>%2</Loc><GrpID>%3</GrpID></ChannelAdd>")
            .arg(NovirSite::escape(name), NovirSite::escape(location), QString::number(groupId));
    post([this, message]() { broadcast(QStringLiteral("ChannelAdd"), QString(), message); });
}

void NovirConfigServer::removeChannel(const QString& name)
{
    {
        QMutexLocker locker(&m_mutex);
        auto it = m_cameras.find(name);
        if (it == m_cameras.end()) {
            return;
        }
        it->location.clear();
    }
    const QString message =
        QStringLiteral("<ChannelRmv><CamName>%1</CamName></ChannelRmv>").arg(NovirSite::escape(name));
    post([this, message]() { broadcast(QStringLiteral("ChannelRmv"), QString(), message); });
}

void NovirConfigServer::sendRawBroadcast(const QString& name, const QString& relayPath,
                                         const QString& message)
{
    post([this, name, relayPath, message]() { broadcast(name, relayPath, message); });
}

void NovirConfigServer::sendRawCameraStatus(const QString& sourceId, const QString& relayPath,
                                            const QString& message)
{
    post([this, sourceId, relayPath, message]() { sendCameraStatus(sourceId, relayPath, message); });
}

NovirSite NovirConfigServer::site() const
{
    QMutexLocker locker(&m_mutex);
    NovirSite site;
    site.serverId = m_strServerId;
    site.partSize = m_partSize;
    site.prettyXml = m_prettyXml;
    site.cameras = m_cameras.values();
    return site;
}

int NovirConfigServer::answeredCount(const QString& cmdName) const
{
    QMutexLocker locker(&m_mutex);
    return m_answered.value(cmdName);
}

int NovirConfigServer::ingestedObjects() const
{
    QMutexLocker locker(&m_mutex);
    return m_ingestedObjects;
}

int NovirConfigServer::failedIngests() const
{
    QMutexLocker locker(&m_mutex);
    return m_failedIngests;
}

void NovirConfigServer::flush()
{
    if (!m_thread.isRunning() || QThread::currentThread() == &m_thread) {
        return;
    }
    QMetaObject::invokeMethod(
        m_context.get(), []() {}, Qt::BlockingQueuedConnection);
}

void* NovirConfigServer::getServerAccountID()
{
    return &m_accountTag;
}

QVariant NovirConfigServer::getServerInfo(Qt::HANDLE clientID, int infoKind)
{
    if (infoKind != NSNovirTunnelClient::kServerInfoServerId ||
        clientID != clientHandle(NSNovirTunnelClient::ConfigServer)) {
        return QVariant();
    }
    QMutexLocker locker(&m_mutex);
    return m_strServerId;
}

bool NovirConfigServer::isServerConnected(NSNovirTunnelClient::ServerType type)
{
    QMutexLocker locker(&m_mutex);
    return (type == NSNovirTunnelClient::ConfigServer && m_configConnected) ||
           (type == NSNovirTunnelClient::LocationServer && m_locationConnected);
}

bool NovirConfigServer::insertRequest(const QString&, void*, NSNovirTunnelClient::ServerType type,
                                      const QString& cmdName, const NSNovirTunnelClient::RequestInfo& request)
{
    if (!isServerConnected(type) || !request.respCB) {
        return false;
    }
    post([this, cmdName, request]() {
        const QList<Part> parts = answer(cmdName, request.strContent);
        for (qsizetype i = 0; i < parts.size(); ++i) {
            request.respCB(parts.at(i).success, cmdName, QString(), parts.at(i).retCode,
                           shaped(parts.at(i).text), i == parts.size() - 1);
        }
        {
            QMutexLocker locker(&m_mutex);
            ++m_answered[cmdName];
        }
        emit requestAnswered(cmdName, parts.last().success);
    });
    return true;
}

bool NovirConfigServer::insertSubscribeRequest(const QString& pluginId, void* clientID,
                                               NSNovirTunnelClient::ServerType type, const QString& cmdName,
                                               const NSNovirTunnelClient::RequestInfo& request,
                                               const QString& serverId,
                                               const NSNovirTunnelClient::EventHandler& eventHandler)
{
    if (type != NSNovirTunnelClient::ConfigServer || cmdName != kSubCamStatus || !eventHandler) {
        return false;
    }
    {
        QMutexLocker locker(&m_mutex);
        if (serverId != m_strServerId) {
            return false; // a subscription for another server
        }
    }
    if (!insertRequest(pluginId, clientID, type, cmdName, request)) {
        return false;
    }
    // Subscribed after the answer; the current states follow at once, then every change.
    post([this, eventHandler]() {
        QString status;
        QString serverId;
        {
            QMutexLocker locker(&m_mutex);
            m_statusSubscribers.append(eventHandler);
            status = NovirSite::cameraStatusXml(m_cameras.values());
            serverId = m_strServerId;
        }
        eventHandler(clientHandle(NSNovirTunnelClient::ConfigServer), serverId, kCamStatus,
                     NSNovirTunnelClient::ConfigServer, QString(), shaped(status));
    });
    return true;
}

void NovirConfigServer::registerConnectStatusHandler(const QString&, NSNovirTunnelClient::ServerType,
                                                     const NSNovirTunnelClient::ConnectStatusHandler& handler,
                                                     const QString&)
{
    if (!handler) {
        return;
    }
    bool configUp = false;
    bool locationUp = false;
    {
        QMutexLocker locker(&m_mutex);
        m_connectHandlers.append(handler);
        configUp = m_configConnected;
        locationUp = m_locationConnected;
    }
    const Qt::HANDLE configId = clientHandle(NSNovirTunnelClient::ConfigServer);
    const Qt::HANDLE locationId = clientHandle(NSNovirTunnelClient::LocationServer);
    post([handler, configUp, locationUp, configId, locationId]() {
        if (configUp) {
            handler(configId, NSNovirTunnelClient::ConfigServer, true);
        }
        if (locationUp) {
            handler(locationId, NSNovirTunnelClient::LocationServer, true);
        }
    });
}

void NovirConfigServer::registerEventHandler(const QString&, void*, NSNovirTunnelClient::ServerType,
                                             const QString& eventName,
                                             const NSNovirTunnelClient::EventHandler& handler, const QString&)
{
    if (!handler) {
        return;
    }
    QMutexLocker locker(&m_mutex);
    m_eventHandlers.insert(eventName, handler);
}

void NovirConfigServer::registerBroadcastHandler(const QString&, void*, NSNovirTunnelClient::ServerType,
                                                 const QString& broadcastName,
                                                 const NSNovirTunnelClient::BroadcastHandler& handler,
                                                 const QString&)
{
    if (!handler) {
        return;
    }
    QMutexLocker locker(&m_mutex);
    m_broadcastHandlers.insert(broadcastName, handler);
}

Qt::HANDLE NovirConfigServer::clientHandle(NSNovirTunnelClient::ServerType type)
{
    return type == NSNovirTunnelClient::LocationServer ? static_cast<Qt::HANDLE>(&m_locationServerTag)
                                                       : static_cast<Qt::HANDLE>(&m_configServerTag);
}

void NovirConfigServer::post(std::function<void()> work)
{
    QMetaObject::invokeMethod(m_context.get(), std::move(work), Qt::QueuedConnection);
}

QList<NovirCamera> NovirConfigServer::camerasSorted() const
{
    QMutexLocker locker(&m_mutex);
    return m_cameras.values(); // QMap: ascending by name
}

QList<NovirConfigServer::Part> NovirConfigServer::answer(const QString& cmdName, const QString& content)
{
    if (cmdName == kGetNodeInfo) {
        return answerNodeInfo(content);
    }
    if (cmdName == kQryLocs) {
        return answerLocations();
    }
    if (cmdName == kSubCamStatus) {
        return {Part{true, kOk, QStringLiteral("<SubCamStatus><Result>OK</Result></SubCamStatus>")}};
    }
    if (cmdName == kInputObjectMetaInfo) {
        return {ingestMetaInfo(content)};
    }
    return {Part{false, kFailed, QString()}};
}

QList<NovirConfigServer::Part> NovirConfigServer::answerNodeInfo(const QString& content)
{
    Quellon quellon;
    const QVariant tree = quellon.parse(content);
    if (!tree.isValid()) {
        return {Part{false, kFailed, QString()}};
    }
    const QString node = rootText(tree, kGetNodeInfo, "Node");
    const QList<NovirCamera> cameras = camerasSorted();
    if (node != kAllCameras) {
        QList<NovirCamera> one;
        for (const NovirCamera& camera : cameras) {
            if (camera.name == node) {
                one.append(camera);
            }
        }
        return {Part{true, kOk, NovirSite::nodeInfoXml(one)}};
    }
    int partSize = 0;
    {
        QMutexLocker locker(&m_mutex);
        partSize = m_partSize;
    }
    QList<Part> parts;
    for (qsizetype i = 0; i < cameras.size(); i += partSize) {
        parts.append(Part{true, kOk, NovirSite::nodeInfoXml(cameras.mid(i, partSize))});
    }
    if (parts.isEmpty()) {
        parts.append(Part{true, kOk, NovirSite::nodeInfoXml({})});
    }
    return parts;
}

QList<NovirConfigServer::Part> NovirConfigServer::answerLocations()
{
    QList<NovirCamera> located;
    for (const NovirCamera& camera : camerasSorted()) {
        if (!camera.location.isEmpty()) {
            located.append(camera);
        }
    }
    int partSize = 0;
    {
        QMutexLocker locker(&m_mutex);
        partSize = m_partSize;
    }
    QList<Part> parts;
    for (qsizetype i = 0; i < located.size(); i += partSize) {
        parts.append(Part{true, kOk, NovirSite::locationsXml(located.mid(i, partSize))});
    }
    if (parts.isEmpty()) {
        parts.append(Part{true, kOk, NovirSite::locationsXml({})});
    }
    return parts;
}

NovirConfigServer::Part NovirConfigServer::ingestMetaInfo(const QString& content)
{
    Quellon quellon;
    const QVariant tree = quellon.parse(content);
    bool groupOk = false;
    bool locationOk = false;
    const int groupId = rootText(tree, kInputObjectMetaInfo, "GroupID").toInt(&groupOk);
    const int locationNumber = rootText(tree, kInputObjectMetaInfo, "LocationID").toInt(&locationOk);
    const QByteArray info = rootText(tree, kInputObjectMetaInfo, "Info").toUtf8();
    if (!tree.isValid() || !groupOk || !locationOk || !m_store) {
        return Part{false, kFailed, QString()};
    }
    const int32_t stored = Tamsa_PutObjectMetaInfo(m_store, groupId, locationNumber, info.constData());
    if (stored < 0) {
        QMutexLocker locker(&m_mutex);
        ++m_failedIngests;
        return Part{false, kFailed, QString()};
    }
    {
        QMutexLocker locker(&m_mutex);
        m_ingestedObjects += stored;
    }
    emit metaInfoIngested(groupId, locationNumber, stored);
    return Part{true, kOk,
                QStringLiteral("<InputObjectMetaInfo><Count>%1</Count></InputObjectMetaInfo>").arg(stored)};
}

QString NovirConfigServer::shaped(const QString& xml) const
{
    return m_prettyXml ? NovirSite::indentedXml(xml) : xml;
}

void NovirConfigServer::broadcast(const QString& name, const QString& relayPath, const QString& message)
{
    QList<NSNovirTunnelClient::BroadcastHandler> handlers;
    {
        QMutexLocker locker(&m_mutex);
        if (!m_configConnected) {
            return;
        }
        handlers = m_broadcastHandlers.values(name);
    }
    for (const auto& handler : handlers) {
        handler(clientHandle(NSNovirTunnelClient::ConfigServer), name, NSNovirTunnelClient::ConfigServer,
                relayPath, shaped(message));
    }
}

void NovirConfigServer::sendCameraStatus(const QString& sourceId, const QString& relayPath,
                                         const QString& message)
{
    QList<NSNovirTunnelClient::EventHandler> handlers;
    {
        QMutexLocker locker(&m_mutex);
        if (!m_configConnected) {
            return;
        }
        handlers = m_statusSubscribers + m_eventHandlers.values(kCamStatus);
    }
    for (const auto& handler : handlers) {
        handler(clientHandle(NSNovirTunnelClient::ConfigServer), sourceId, kCamStatus,
                NSNovirTunnelClient::ConfigServer, relayPath, shaped(message));
    }
}
