#pragma once
// The host's tunnel client towards the management system's servers (the configuration server
// and the server that answers location queries).
//
// Ownership: the host owns the client and keeps it for the plug-in's life; callers never free
// it. Handlers and response callbacks are copied into the client and stay registered.
//
// Threads: every operation may be called from any thread. Handlers and response callbacks are
// called later, never from inside the call that registered or sent them, and always from the
// client's own thread, one at a time. A receiver that may die first must guard its callbacks.
//
// Failures: insertRequest and insertSubscribeRequest return false when the request is refused
// (unknown server kind, server not connected); no callback follows then. An accepted request
// gets its response callback once per answer part, finish set on the last one; a failed part
// has success false and a return code other than "0".

#include <QString>
#include <QVariant>
#include <QtGlobal>
#include <functional>

namespace NSNovirTunnelClient {

enum ServerType
{
    ConfigServer = 1,   // node information, camera status, broadcasts, the plug-ins' own requests
    LocationServer = 4, // recording locations
    ConnectStatus = 5,  // kind under which connection-state handlers are registered
};

// Response callback: (success, command name, relay path, return code, answer text, finish).
using ResponseCallback =
    std::function<void(bool, const QString&, const QString&, const QString&, const QString&, bool)>;
// Connection-state handler: (clientID, server kind, connected).
using ConnectStatusHandler = std::function<void(Qt::HANDLE, ServerType, bool)>;
// Broadcast handler: (clientID, broadcast name, server kind, relay path, message text).
using BroadcastHandler =
    std::function<void(Qt::HANDLE, const QString&, ServerType, const QString&, const QString&)>;
// Event handler: (clientID, source id, event name, server kind, relay path, message text).
using EventHandler = std::function<void(Qt::HANDLE, const QString&, const QString&, ServerType,
                                        const QString&, const QString&)>;

// One request as handed to the client.
struct RequestInfo
{
    int nPriority = 0;       // always 0 from the plug-in
    int nTimeoutMs = 15000;  // how long the client waits for the answer's next part
    QString strContent;      // the XML content of the command
    QString strExtra;        // passed through untouched
    ResponseCallback respCB; // called per answer part
};

// getServerInfo kinds.
constexpr int kServerInfoServerId = 3;

} // namespace NSNovirTunnelClient

class INovirTunnelClient
{
public:
    // Handle of the account the host is logged in with; passed as clientID of requests.
    virtual void* getServerAccountID() = 0;
    // Information about the server behind clientID; kind 3 is its id, as text.
    virtual QVariant getServerInfo(Qt::HANDLE clientID, int infoKind) = 0;
    // True while a server of this kind is connected.
    virtual bool isServerConnected(NSNovirTunnelClient::ServerType type) = 0;
    virtual bool insertRequest(const QString& pluginId, void* clientID, NSNovirTunnelClient::ServerType type,
                               const QString& cmdName, const NSNovirTunnelClient::RequestInfo& request) = 0;
    // A request that also subscribes eventHandler to the events that serverId sends for it.
    virtual bool insertSubscribeRequest(const QString& pluginId, void* clientID,
                                        NSNovirTunnelClient::ServerType type, const QString& cmdName,
                                        const NSNovirTunnelClient::RequestInfo& request,
                                        const QString& serverId,
                                        const NSNovirTunnelClient::EventHandler& eventHandler) = 0;
    // The handler learns of every connection and disconnection from now on, and of the servers
    // already connected when it registers.
    virtual void registerConnectStatusHandler(const QString& pluginId, NSNovirTunnelClient::ServerType type,
                                              const NSNovirTunnelClient::ConnectStatusHandler& handler,
                                              const QString& reserved) = 0;
    virtual void registerEventHandler(const QString& pluginId, void* clientID,
                                      NSNovirTunnelClient::ServerType type, const QString& eventName,
                                      const NSNovirTunnelClient::EventHandler& handler,
                                      const QString& reserved) = 0;
    virtual void registerBroadcastHandler(const QString& pluginId, void* clientID,
                                          NSNovirTunnelClient::ServerType type, const QString& broadcastName,
                                          const NSNovirTunnelClient::BroadcastHandler& handler,
                                          const QString& reserved) = 0;

protected:
    ~INovirTunnelClient() = default; // the host owns the client; callers never delete it
};
