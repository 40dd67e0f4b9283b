#pragma once
// The host's services for a plug-in, handed to InitialPluginBase and valid for the
// plug-in's life. Nothing returned is owned by the plug-in.

class IPluginManager;
class IRelaySender;
class INovirTunnelClient;

class IFrameworkTools
{
public:
    virtual IPluginManager* GetPluginManager() = 0;
    virtual INovirTunnelClient* GetNovirTunnelClient() = 0; // null when the host has no configuration server
    virtual IRelaySender* GetRelaySender() = 0;

protected:
    ~IFrameworkTools() = default;
};
