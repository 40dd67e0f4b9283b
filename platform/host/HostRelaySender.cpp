#include "HostRelaySender.h"

#include "IPluginManager.h"

#include <QMetaObject>

void HostRelaySender::addRemoteServer(const QString& strRelayPath, IPluginManager* remoteManager)
{
    QMutexLocker lock(&m_mutex);
    m_remoteServers.insert(strRelayPath, remoteManager);
}

void HostRelaySender::removeRemoteServer(const QString& strRelayPath)
{
    QMutexLocker lock(&m_mutex);
    m_remoteServers.remove(strRelayPath);
}

bool HostRelaySender::RelayRequest(const QString& strPluginId, const QString& strCommand,
                                   const QVariant& params, bool, const QString& strRelayPath,
                                   HDLR_RELAY_RESPONSE_CB hdlrResponse)
{
    IPluginManager* remote = nullptr;
    {
        QMutexLocker lock(&m_mutex);
        remote = m_remoteServers.value(strRelayPath, nullptr);
    }
    if (strRelayPath.isEmpty() || !remote) {
        return false;
    }
    QObject* target = remote->GetPluginObject(strPluginId);
    if (!target) {
        return false;
    }
    // The remote plug-in answers with the ordinary reply callback; translate it into the
    // relay's answer shape.
    HDLR_DO_REQUEST_CB reply = [hdlrResponse](bool bFinal, const QString& strCode, const QString& strMessage,
                                              const QVariant& payload) {
        if (hdlrResponse) {
            hdlrResponse(true, payload, strCode, strMessage, bFinal);
        }
    };
    RequestSenderInfo relaySender;
    relaySender.strSenderName = QStringLiteral("relay");
    relaySender.strSenderAddress = strRelayPath;
    return QMetaObject::invokeMethod(target, strCommand.toLatin1().constData(), Qt::AutoConnection,
                                     Q_ARG(QVariant, params), Q_ARG(RequestSenderInfo, relaySender),
                                     Q_ARG(HDLR_DO_REQUEST_CB, reply));
}
