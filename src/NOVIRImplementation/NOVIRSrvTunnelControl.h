#pragma once
// The camera directory's traffic with the configuration server, over the host's tunnel client:
// registers the plug-in's handlers, sends the fixed commands (all cameras, one camera, all
// locations, camera status subscription) and turns answers, broadcasts and events into signals.
//
// Threads: handlers and response callbacks run on the tunnel client's thread and emit from
// there; receivers reach their own thread through queued connections. The client keeps the
// handlers registered after this object is gone, so every handler goes through a shared guard:
// once the destructor has run, a late call finds the guard revoked and returns. The destructor
// waits for a handler that is running at that moment.

#include "INovirTunnelClient.h"
#include "Quellon.h"

#include <QMap>
#include <QObject>
#include <QReadWriteLock>
#include <QString>
#include <QVariant>
#include <functional>
#include <memory>

class NOVIRSrvTunnelControl : public QObject
{
    Q_OBJECT
public:
    explicit NOVIRSrvTunnelControl(INovirTunnelClient* client);
    // As above, but connectSignals is called with the new object before any handler is
    // registered. The client may call a handler on its own thread at once, and a signal emitted
    // before its receivers are connected is lost; receivers that must see the first answers
    // connect here.
    NOVIRSrvTunnelControl(INovirTunnelClient* client,
                          const std::function<void(NOVIRSrvTunnelControl*)>& connectSignals);
    ~NOVIRSrvTunnelControl() override;

    bool sendRequest(void* clientID, const QString& cmdName, const QString& content, const QString& extra,
                     void* context, NSNovirTunnelClient::ServerType type);
    void* getServerAccountID() const;
    bool registerBroadcastHandler(void* clientID);
    bool registerEventHandler(void* clientID, const QString& eventName, NSNovirTunnelClient::ServerType type);

    // Handlers, called by the tunnel client.
    void hdlrConnectStatus(Qt::HANDLE clientID, NSNovirTunnelClient::ServerType type, bool connected);
    void hdlrBroadcastResp(Qt::HANDLE clientID, const QString& name, NSNovirTunnelClient::ServerType type,
                           const QString& relayPath, const QString& message);
    void hdlrCameraStatusChanged(Qt::HANDLE clientID, const QString& sourceId, const QString& eventName,
                                 NSNovirTunnelClient::ServerType type, const QString& relayPath,
                                 const QString& message);
    void hdlrEventTrigger(Qt::HANDLE clientID, const QString& sourceId, const QString& eventName,
                          NSNovirTunnelClient::ServerType type, const QString& relayPath,
                          const QString& message);
    void hdlrReqResp(bool success, const QString& cmdName, const QString& relayPath, const QString& retCode,
                     const QString& transRespMsg, bool finish, void*, void* context);

signals:
    void connectProc(Qt::HANDLE clientID, bool bConnected);
    void reqResp(bool success, bool finish, QString transRespMsg, QString relayPath, void* pvContext,
                 const QString& retCode);
    void evtResp(Qt::HANDLE clientID, QString relayPath, QString eventMsg);
    void broadcastResp(Qt::HANDLE clientID, QString relayPath, QString eventMsg, QString cmdName);
    void updateCameras(const QVariantMap& camerasMap);
    void updateCamera(const QString& cameraName, const QVariantMap& cameraNodeInfo);
    void removeCamera(const QString& cameraName);
    void updateLocations(const QVariantMap& locationsMap);
    void addLocation(const QString& cameraName, const QVariantMap& locationInfo);
    void removeLocation(const QString& cameraName);
    void updateCameraStatus(const QString& cameraName, bool isConnected);

private:
    // Shared by this object and every callback handed to the client. A callback holds the read
    // lock while it runs (recursively, since a handler may send a request whose callback a
    // client calls at once); the destructor takes the write lock and clears m_pReceiver.
    struct CallbackGuard
    {
        QReadWriteLock lock{QReadWriteLock::Recursive};
        NOVIRSrvTunnelControl* m_pReceiver = nullptr; // guarded by lock
    };
    template <typename Function>
    static void callGuarded(const std::shared_ptr<CallbackGuard>& guard, Function&& function);

    void sendGetAllCameraNodeInfo();
    void sendGetCameraNodeInfo(const QString& cameraName);
    void sendQueryAllLocations();
    void subscribeCameraStatusEvent();
    void InsReqRespCB(bool success, const QString& cmdName, const QString& relayPath, const QString& retCode,
                      const QString& transRespMsg, bool finish);
    QMap<QString, QVariant> parseNodeInfo(const QString& answer);
    QMap<QString, QVariant> parseQueryLocations(const QString& answer);

    NSNovirTunnelClient::RequestInfo makeRequest(const QString& content, const QString& extra,
                                                 NSNovirTunnelClient::ResponseCallback callback) const;

    INovirTunnelClient* m_pNovirTunnelClient = nullptr; // borrowed from the host, may be null
    // The members below are used only from the tunnel client's callbacks, which the client
    // calls one at a time; they need no lock of their own.
    Quellon m_quellon;
    QVariantMap m_locationsMap;
    QString m_strServerId;
    std::shared_ptr<CallbackGuard> m_guard;
};
