#pragma once
// Test modules that must be refused by the host: one with a foreign interface id, one with
// the right interface id but another PluginID.

#include "IPluginObjectBase.h"

class WrongIdPlugin : public IPluginObjectBase
{
    Q_OBJECT
#if defined(WRONG_IID)
    Q_PLUGIN_METADATA(IID "com.example.Other.PluginInterface" FILE "WrongIdPlugin.json")
#else
    Q_PLUGIN_METADATA(IID "com.Quorvex.PluginServer.PluginInterface" FILE "WrongIdPlugin.json")
#endif
    Q_INTERFACES(IPluginObjectBase)
public:
    bool InitialPluginBase(IFrameworkTools*) override
    {
        return true;
    }
    void Request(const QString&, const QVariant&, const RequestSenderInfo&, HDLR_DO_REQUEST_CB) override
    {}
    void RequestBlock(const QString&, const QVariant&, const RequestSenderInfo&, IResponser&) override
    {}
    void SubscribeEventBlock(const QString&, const QString&, const QVariant&, const RequestSenderInfo&,
                             IResponser&) override
    {}
    void UnsubscribeEventBlock(const QString&, const QVariant&, IResponser&) override
    {}
};
