#pragma once
// The object a host plug-in module exposes. The host creates it through the Qt plug-in
// instance function, calls InitialPluginBase and then AllPluginLoaded on the thread that
// runs its event loop, and delivers Request from its pool of request threads.

#include "HostCallbacks.h"
#include "IResponser.h"
#include "RequestSenderInfo.h"

#include <QObject>
#include <QString>
#include <QVariant>
#include <QtPlugin>

class IFrameworkTools;

// Deliberately without Q_OBJECT: the interface adds no signals or slots, and a header-only
// interface shared by host and modules must not carry a meta-object of its own.
class IPluginObjectBase : public QObject
{
public:
    using QObject::QObject;

    virtual bool InitialPluginBase(IFrameworkTools* pTools) = 0;
    // Asynchronous request: answered through hdlrDoRequestCB, now or later, from any thread.
    virtual void Request(const QString& strCommand, const QVariant& params,
                         const RequestSenderInfo& senderInfo, HDLR_DO_REQUEST_CB hdlrDoRequestCB) = 0;
    virtual void RequestBlock(const QString& strCommand, const QVariant& params,
                              const RequestSenderInfo& senderInfo, IResponser& responser) = 0;
    virtual void SubscribeEventBlock(const QString& strEvent, const QString& strFilter,
                                     const QVariant& params, const RequestSenderInfo& senderInfo,
                                     IResponser& responser) = 0;
    virtual void UnsubscribeEventBlock(const QString& strEvent, const QVariant& params,
                                       IResponser& responser) = 0;

    virtual void PluginLoaded() {}
    virtual void AllPluginLoaded() {}
    virtual void PrepareUnload() {}
    virtual void ServerStopping() {}
    virtual QVariant GetPluginProperty(const QString& /*strName*/) { return QVariant(); }
    virtual void SettingsChanged() {}
};

#define IPluginObjectBase_iid "com.Quorvex.PluginServer.PluginInterface"
Q_DECLARE_INTERFACE(IPluginObjectBase, IPluginObjectBase_iid)
