#pragma once
// Sends a request to a plug-in of another server, named by a relay path. Not owned by
// the plug-in; callable from any thread. The response callback is called once, on a
// thread of the relay's choosing, and only when RelayRequest returned true.

#include "HostCallbacks.h"

#include <QString>
#include <QVariant>

class IRelaySender
{
public:
    virtual bool RelayRequest(const QString& strPluginId, const QString& strCommand, const QVariant& params,
                              bool bBlock, const QString& strRelayPath,
                              HDLR_RELAY_RESPONSE_CB hdlrResponse) = 0;

protected:
    ~IRelaySender() = default;
};
