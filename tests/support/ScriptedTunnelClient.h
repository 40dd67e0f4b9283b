#pragma once
// A tunnel client the test drives by hand: it records every registration and request and calls
// the handlers and response callbacks only when the test says so, on the test's thread.
// Header-only; used by the camera directory tests and the directory fuzz targets.

#include "INovirTunnelClient.h"

#include <QList>
#include <QString>
#include <functional>

class ScriptedTunnelClient : public INovirTunnelClient
{
public:
    using ServerType = NSNovirTunnelClient::ServerType;
    static constexpr ServerType Config = NSNovirTunnelClient::ConfigServer;
    struct Request
    {
        void* clientID = nullptr;
        ServerType type = Config;
        QString cmdName;
        NSNovirTunnelClient::RequestInfo info;
        QString serverId;
        NSNovirTunnelClient::EventHandler eventHandler;
    };

    // The hastiest client possible: servers already up are reported from inside the
    // registration, and onInsert may answer a request from inside the call that sent it.
    bool connectOnRegister = false;
    std::function<void(int requestIndex)> onInsert;
    QString serverId = QStringLiteral("srv-1");
    QList<Request> requests;
    QList<QPair<QString, NSNovirTunnelClient::BroadcastHandler>> broadcastHandlers;
    QList<NSNovirTunnelClient::ConnectStatusHandler> connectHandlers;
    char account = 0;
    char servers[2] = {};

    Qt::HANDLE handleOf(ServerType type) { return &servers[type != Config]; }
    void connectServer(ServerType type, bool connected = true)
    {
        for (const auto& handler : QList(connectHandlers)) {
            handler(handleOf(type), type, connected);
        }
    }
    void answer(int index, bool success, const QString& retCode, const QString& text, bool finish = true)
    {
        const Request request = requests.at(index);
        request.info.respCB(success, request.cmdName, QString(), retCode, text, finish);
    }
    // Index of the last request sent under this command name, -1 when none.
    int lastRequest(const QString& cmdName) const
    {
        int i = int(requests.size()) - 1;
        while (i >= 0 && requests.at(i).cmdName != cmdName) {
            --i;
        }
        return i;
    }
    void broadcast(const QString& name, const QString& relayPath, const QString& message)
    {
        for (const auto& [registered, handler] : QList(broadcastHandlers)) {
            if (registered == name) {
                handler(handleOf(Config), name, Config, relayPath, message);
            }
        }
    }
    // Sends a status event through the subscription's handler.
    void statusEvent(const QString& sourceId, const QString& relayPath, const QString& message)
    {
        requests.at(lastRequest(QStringLiteral("SubCamStatus")))
            .eventHandler(handleOf(Config), sourceId, QStringLiteral("CamStatus"), Config, relayPath,
                          message);
    }

    void* getServerAccountID() override { return &account; }
    QVariant getServerInfo(Qt::HANDLE clientID, int infoKind) override
    {
        return clientID == handleOf(Config) && infoKind == 3 ? QVariant(serverId) : QVariant();
    }
    bool isServerConnected(ServerType) override { return true; }
    bool insertRequest(const QString&, void* clientID, ServerType type, const QString& cmdName,
                       const NSNovirTunnelClient::RequestInfo& request) override
    {
        return insert(Request{clientID, type, cmdName, request, QString(), {}});
    }
    bool insertSubscribeRequest(const QString&, void* clientID, ServerType type, const QString& cmdName,
                                const NSNovirTunnelClient::RequestInfo& request,
                                const QString& subscribedServerId,
                                const NSNovirTunnelClient::EventHandler& eventHandler) override
    {
        return insert(Request{clientID, type, cmdName, request, subscribedServerId, eventHandler});
    }
    void registerConnectStatusHandler(const QString&, ServerType,
                                      const NSNovirTunnelClient::ConnectStatusHandler& handler,
                                      const QString&) override
    {
        connectHandlers.append(handler);
        if (connectOnRegister) {
            handler(handleOf(Config), Config, true);
            handler(handleOf(NSNovirTunnelClient::LocationServer), NSNovirTunnelClient::LocationServer, true);
        }
    }
    void registerEventHandler(const QString&, void*, ServerType, const QString&,
                              const NSNovirTunnelClient::EventHandler&, const QString&) override
    {}
    void registerBroadcastHandler(const QString&, void*, ServerType, const QString& broadcastName,
                                  const NSNovirTunnelClient::BroadcastHandler& handler,
                                  const QString&) override
    {
        broadcastHandlers.append({broadcastName, handler});
    }

private:
    bool insert(Request request)
    {
        requests.append(std::move(request));
        if (onInsert) {
            onInsert(int(requests.size()) - 1);
        }
        return true;
    }
};

// Answers in the configuration server's formats.
inline QString nodeInfo(const QStringList& names)
{
    QString cameras;
    for (const QString& name : names) {
        cameras += QStringLiteral("<Cam><Name>%1</Name><ObjectMetaRecordCap>true</ObjectMetaRecordCap></Cam>")
                       .arg(name);
    }
    return QStringLiteral("<NodeInfo><Cameras>%1</Cameras></NodeInfo>").arg(cameras);
}
inline QString locRecs(const QString& alias, const QString& location, int group = 1,
                       const QString& live = "true")
{
    return QStringLiteral(
               "<LocRecs><LocList><Live>%1</Live><Loc><Alias>%2</Alias><Name>%3</Name><GrpID>%4</GrpID>"
               "</Loc></LocList></LocRecs>")
        .arg(live, alias, location)
        .arg(group);
}
