#pragma once
// A tunnel client the test drives by hand: it records every registration and request and calls
// the handlers and response callbacks only when the test says so, on the test's thread.

#include "INovirTunnelClient.h"

#include <QList>
#include <QString>
#include <functional>

class ScriptedTunnelClient : public INovirTunnelClient
{
public:
    struct Request
    {
        QString pluginId;
        void* clientID = nullptr;
        NSNovirTunnelClient::ServerType type = NSNovirTunnelClient::ConfigServer;
        QString cmdName;
        NSNovirTunnelClient::RequestInfo info;
        bool subscribe = false;
        QString serverId;
        NSNovirTunnelClient::EventHandler eventHandler;
    };
    struct Registration
    {
        QString pluginId;
        NSNovirTunnelClient::ServerType type;
        QString name;
    };

    bool accept = true; // what insertRequest and insertSubscribeRequest answer
    // The hastiest client possible: servers already up are reported from inside the
    // registration, and onInsert may answer a request from inside the call that sent it.
    bool connectOnRegister = false;
    std::function<void(int requestIndex)> onInsert;
    QString serverId = QStringLiteral("srv-1");
    QList<Request> requests;
    QList<Registration> connectRegistrations;
    QList<Registration> broadcastRegistrations;
    QList<Registration> eventRegistrations;
    QList<NSNovirTunnelClient::ConnectStatusHandler> connectHandlers;
    QList<NSNovirTunnelClient::BroadcastHandler> broadcastHandlers; // parallel to broadcastRegistrations
    QList<NSNovirTunnelClient::EventHandler> eventHandlers;         // parallel to eventRegistrations
    char account = 0;
    char configServer = 0;
    char locationServer = 0;

    Qt::HANDLE handleOf(NSNovirTunnelClient::ServerType type)
    {
        return type == NSNovirTunnelClient::LocationServer ? static_cast<Qt::HANDLE>(&locationServer)
                                                           : static_cast<Qt::HANDLE>(&configServer);
    }

    // ---- test verbs ----
    void connectServer(NSNovirTunnelClient::ServerType type, bool connected = true)
    {
        const auto handlers = connectHandlers;
        for (const auto& handler : handlers) {
            handler(handleOf(type), type, connected);
        }
    }
    // Answers the request at index with one part.
    void answer(int index, bool success, const QString& retCode, const QString& text, bool finish = true)
    {
        const Request request = requests.at(index);
        request.info.respCB(success, request.cmdName, QString(), retCode, text, finish);
    }
    // Index of the last request sent under this command name, -1 when none.
    int lastRequest(const QString& cmdName) const
    {
        for (int i = requests.size() - 1; i >= 0; --i) {
            if (requests.at(i).cmdName == cmdName) {
                return i;
            }
        }
        return -1;
    }
    int countRequests(const QString& cmdName) const
    {
        int count = 0;
        for (const Request& request : requests) {
            count += request.cmdName == cmdName ? 1 : 0;
        }
        return count;
    }
    void broadcast(const QString& name, const QString& relayPath, const QString& message)
    {
        for (int i = 0; i < broadcastRegistrations.size(); ++i) {
            if (broadcastRegistrations.at(i).name == name) {
                broadcastHandlers.at(i)(handleOf(NSNovirTunnelClient::ConfigServer), name,
                                        NSNovirTunnelClient::ConfigServer, relayPath, message);
            }
        }
    }
    // Sends a status event through the subscription's handler.
    void statusEvent(const QString& sourceId, const QString& relayPath, const QString& message)
    {
        const int index = lastRequest(QStringLiteral("SubCamStatus"));
        requests.at(index).eventHandler(handleOf(NSNovirTunnelClient::ConfigServer), sourceId,
                                        QStringLiteral("CamStatus"), NSNovirTunnelClient::ConfigServer,
                                        relayPath, message);
    }

    // ---- INovirTunnelClient ----
    void* getServerAccountID() override { return &account; }
    QVariant getServerInfo(Qt::HANDLE clientID, int infoKind) override
    {
        return clientID == handleOf(NSNovirTunnelClient::ConfigServer) && infoKind == 3 ? QVariant(serverId)
                                                                                        : QVariant();
    }
    bool isServerConnected(NSNovirTunnelClient::ServerType) override { return true; }
    bool insertRequest(const QString& pluginId, void* clientID, NSNovirTunnelClient::ServerType type,
                       const QString& cmdName, const NSNovirTunnelClient::RequestInfo& request) override
    {
        requests.append(Request{pluginId, clientID, type, cmdName, request, false, QString(), {}});
        if (onInsert) {
            onInsert(int(requests.size()) - 1);
        }
        return accept;
    }
    bool insertSubscribeRequest(const QString& pluginId, void* clientID, NSNovirTunnelClient::ServerType type,
                                const QString& cmdName, const NSNovirTunnelClient::RequestInfo& request,
                                const QString& subscribedServerId,
                                const NSNovirTunnelClient::EventHandler& eventHandler) override
    {
        requests.append(
            Request{pluginId, clientID, type, cmdName, request, true, subscribedServerId, eventHandler});
        if (onInsert) {
            onInsert(int(requests.size()) - 1);
        }
        return accept;
    }
    void registerConnectStatusHandler(const QString& pluginId, NSNovirTunnelClient::ServerType type,
                                      const NSNovirTunnelClient::ConnectStatusHandler& handler,
                                      const QString&) override
    {
        connectRegistrations.append(Registration{pluginId, type, QString()});
        connectHandlers.append(handler);
        if (connectOnRegister) {
            handler(handleOf(NSNovirTunnelClient::ConfigServer), NSNovirTunnelClient::ConfigServer, true);
            handler(handleOf(NSNovirTunnelClient::LocationServer), NSNovirTunnelClient::LocationServer, true);
        }
    }
    void registerEventHandler(const QString& pluginId, void*, NSNovirTunnelClient::ServerType type,
                              const QString& eventName, const NSNovirTunnelClient::EventHandler& handler,
                              const QString&) override
    {
        eventRegistrations.append(Registration{pluginId, type, eventName});
        eventHandlers.append(handler);
    }
    void registerBroadcastHandler(const QString& pluginId, void*, NSNovirTunnelClient::ServerType type,
                                  const QString& broadcastName,
                                  const NSNovirTunnelClient::BroadcastHandler& handler,
                                  const QString&) override
    {
        broadcastRegistrations.append(Registration{pluginId, type, broadcastName});
        broadcastHandlers.append(handler);
    }
};
