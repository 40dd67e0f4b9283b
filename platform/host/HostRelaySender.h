#pragma once
// The host's relay towards plug-ins of other servers. A relay path names a remote server
// configured in the host; a path that names none is refused (false) and nothing is called.

#include "IRelaySender.h"

#include <QHash>
#include <QMutex>
#include <QPointer>

class IPluginManager;

class HostRelaySender : public IRelaySender
{
public:
    // Makes the plug-ins of remoteManager reachable under strRelayPath. The manager is
    // borrowed and must outlive this relay or be removed first.
    void addRemoteServer(const QString& strRelayPath, IPluginManager* remoteManager);
    void removeRemoteServer(const QString& strRelayPath);

    bool RelayRequest(const QString& strPluginId, const QString& strCommand, const QVariant& params,
                      bool bBlock, const QString& strRelayPath, HDLR_RELAY_RESPONSE_CB hdlrResponse) override;

private:
    QMutex m_mutex;                                  // guards m_remoteServers
    QHash<QString, IPluginManager*> m_remoteServers; // guarded by m_mutex
};
