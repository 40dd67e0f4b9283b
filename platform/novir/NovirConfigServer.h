#pragma once
// An in-process configuration server behind the tunnel client interface. It keeps a site
// (NovirSite), answers "GetNodeInfo", "QryLocs", "SubCamStatus" and "InputObjectMetaInfo",
// sends the broadcasts and "CamStatus" events when the site changes, and stores every
// "InputObjectMetaInfo" in the object-metadata store (when one was opened).
//
// Ownership: the creator owns the server and must keep it until every user of the client is
// gone; handlers handed to it are kept until it is destroyed.
//
// Threads: every public operation may be called from any thread. The server runs its own
// thread; every handler and response callback is called from it, one at a time, never from
// inside the call that registered or sent it, and never while a lock of the server is held
// (so a callback may call the server again). The signals are emitted from that thread.
//
// Failures: requests to a server kind that is not connected are refused (false). An unknown
// command, a malformed command text or an ingest failure is answered with success false and
// return code "-1" in one part.

#include "INovirTunnelClient.h"
#include "NovirSite.h"

#include <QHash>
#include <QMap>
#include <QMutex>
#include <QObject>
#include <QThread>
#include <functional>
#include <memory>

class NovirConfigServer : public QObject, public INovirTunnelClient
{
    Q_OBJECT
public:
    explicit NovirConfigServer(const NovirSite& site, QObject* parent = nullptr);
    ~NovirConfigServer() override;

    // Opens the store under storageDir for "InputObjectMetaInfo"; call it before start(), the
    // store is then used on the server thread only. False with a reason otherwise.
    bool openStore(const QString& storageDir, QString* error);
    // Starts the thread and brings both servers up (kinds 1 and 4).
    void start();
    // Brings a server kind up or down; connection-state handlers learn of it.
    void setServerConnected(NSNovirTunnelClient::ServerType type, bool connected);

    // Site changes, each followed by what the real server sends about it.
    void addCamera(const NovirCamera& camera);              // "CamIns" (+ "ChannelAdd", "CamStatus")
    void changeCamera(const NovirCamera& camera);           // "CamInfoChange"
    void removeCamera(const QString& name);                 // "CamRmv"
    void setCameraOnline(const QString& name, bool online); // "CamStatus"
    void addChannel(const QString& name, const QString& location, int groupId); // "ChannelAdd"
    void removeChannel(const QString& name);                                    // "ChannelRmv"
    // Sends a message as given, for tests of foreign or malformed traffic.
    void sendRawBroadcast(const QString& name, const QString& relayPath, const QString& message);
    void sendRawCameraStatus(const QString& sourceId, const QString& relayPath, const QString& message);

    NovirSite site() const;
    int answeredCount(const QString& cmdName) const;
    int ingestedObjects() const;
    // Answers the store refused (a read-only or full storage directory, ...).
    int failedIngests() const;
    // Blocks until the server thread has worked off everything posted to it before this call.
    void flush();

    // INovirTunnelClient
    void* getServerAccountID() override;
    QVariant getServerInfo(Qt::HANDLE clientID, int infoKind) override;
    bool isServerConnected(NSNovirTunnelClient::ServerType type) override;
    bool insertRequest(const QString& pluginId, void* clientID, NSNovirTunnelClient::ServerType type,
                       const QString& cmdName, const NSNovirTunnelClient::RequestInfo& request) override;
    bool insertSubscribeRequest(const QString& pluginId, void* clientID, NSNovirTunnelClient::ServerType type,
                                const QString& cmdName, const NSNovirTunnelClient::RequestInfo& request,
                                const QString& serverId,
                                const NSNovirTunnelClient::EventHandler& eventHandler) override;
    void registerConnectStatusHandler(const QString& pluginId, NSNovirTunnelClient::ServerType type,
                                      const NSNovirTunnelClient::ConnectStatusHandler& handler,
                                      const QString& reserved) override;
    void registerEventHandler(const QString& pluginId, void* clientID, NSNovirTunnelClient::ServerType type,
                              const QString& eventName, const NSNovirTunnelClient::EventHandler& handler,
                              const QString& reserved) override;
    void registerBroadcastHandler(const QString& pluginId, void* clientID,
                                  NSNovirTunnelClient::ServerType type, const QString& broadcastName,
                                  const NSNovirTunnelClient::BroadcastHandler& handler,
                                  const QString& reserved) override;

signals:
    // After the last part of an answer went out.
    void requestAnswered(const QString& cmdName, bool success);
    void metaInfoIngested(int groupId, int locationNumber, int objectCount);

private:
    struct Part
    {
        bool success;
        QString retCode;
        QString text;
    };

    Qt::HANDLE clientHandle(NSNovirTunnelClient::ServerType type);
    void post(std::function<void()> work);
    // Runs on the server thread.
    QList<Part> answer(const QString& cmdName, const QString& content);
    QList<Part> answerNodeInfo(const QString& content);
    QList<Part> answerLocations();
    Part ingestMetaInfo(const QString& content);
    QString shaped(const QString& xml) const; // indented when the site asks for it
    void broadcast(const QString& name, const QString& relayPath, const QString& message);
    void sendCameraStatus(const QString& sourceId, const QString& relayPath, const QString& message);
    QList<NovirCamera> camerasSorted() const;

    QThread m_thread;
    std::unique_ptr<QObject> m_context; // lives in m_thread; posted work runs on it
    char m_accountTag = 0;
    char m_configServerTag = 0;
    char m_locationServerTag = 0;

    mutable QMutex m_mutex;
    QString m_strServerId; // guarded by m_mutex
    int m_partSize = 50;   // guarded by m_mutex
    const bool m_prettyXml;
    QMap<QString, NovirCamera> m_cameras;                                           // guarded by m_mutex
    bool m_configConnected = false;                                                 // guarded by m_mutex
    bool m_locationConnected = false;                                               // guarded by m_mutex
    QList<NSNovirTunnelClient::ConnectStatusHandler> m_connectHandlers;             // guarded by m_mutex
    QMultiHash<QString, NSNovirTunnelClient::BroadcastHandler> m_broadcastHandlers; // guarded by m_mutex
    QMultiHash<QString, NSNovirTunnelClient::EventHandler> m_eventHandlers;         // guarded by m_mutex
    QList<NSNovirTunnelClient::EventHandler> m_statusSubscribers;                   // guarded by m_mutex
    QHash<QString, int> m_answered;                                                 // guarded by m_mutex
    int m_ingestedObjects = 0;                                                      // guarded by m_mutex
    int m_failedIngests = 0;                                                        // guarded by m_mutex
    void* m_store = nullptr; // used on the server thread only, after openStore
};
