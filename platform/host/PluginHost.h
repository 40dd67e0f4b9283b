#pragma once
// The in-process plug-in host: loads a plug-in module, hands it the framework services and
// drives it the way the management server does.
//
// Threads: construct, load() and unload() on the thread that runs the Qt event loop (the
// plug-in object lives there and gets InitialPluginBase and AllPluginLoaded there). request()
// may be called from any thread; it delivers Request on one of the host's request threads,
// several at once.
//
// Data folder: everything the server keeps lives under one folder: the server database path
// ("<data>/database"), the store's installation directory ("<data>", so its storage is
// "<data>/Server") published as the machine setting "INSTALL_PATH", and the bookmarks
// ("<data>/bookmarks.json"). Remote servers reachable through the relay are named in
// "<data>/host.json" as {"remoteServers": ["east", ...]}; each keeps its bookmarks in
// "<data>/remotes/<name in hex>/bookmarks.json".

#include "BookmarkPlugin.h"
#include "HostPluginManager.h"
#include "HostRelaySender.h"
#include "IFrameworkTools.h"
#include "IPluginObjectBase.h"
#include "PluginServerInfo.h"

#include <QObject>
#include <QPluginLoader>
#include <QPointer>
#include <QThreadPool>
#include <map>
#include <memory>

class PluginHost : public QObject, public IFrameworkTools
{
    Q_OBJECT
public:
    static constexpr const char* kExpectedPluginId = "d2792a6a286548ecb47417172e5e5fa7";

    explicit PluginHost(const QString& strDataDir, QObject* parent = nullptr);
    ~PluginHost() override;

    // Loads the module, checks its interface id and PluginID, then calls InitialPluginBase
    // and AllPluginLoaded. On failure returns false with a message for a person in *error.
    bool load(const QString& strModulePath, QString* error);
    // Waits for running requests, then destroys the plug-in object and unloads the module.
    void unload();

    IPluginObjectBase* plugin() const { return m_plugin.data(); }
    void request(const QString& strCommand, const QVariant& params, const RequestSenderInfo& senderInfo,
                 HDLR_DO_REQUEST_CB hdlrDoRequestCB);
    // Blocks until every delivered request has returned from Request (not until it answered).
    void waitForRequests();

    QString dataDir() const { return m_strDataDir; }
    HostPluginManager& pluginManager() { return m_pluginManager; }
    HostRelaySender& relaySender() { return m_relaySender; }
    PluginServerInfo& serverInfo() { return *m_serverInfo; }
    BookmarkPlugin& bookmarkPlugin() { return *m_bookmarkPlugin; }
    // Makes a remote server with its own bookmark plug-in reachable under strRelayPath.
    BookmarkPlugin& addRemoteServer(const QString& strRelayPath);
    // The bookmark plug-in of a remote server, or null.
    BookmarkPlugin* remoteBookmarkPlugin(const QString& strRelayPath) const;
    void setNovirTunnelClient(INovirTunnelClient* client) { m_pNovirTunnelClient = client; }

    // The module built next to this program: <bin>/../plugins/libPluginDelvixSrv.so.
    static QString defaultModulePath();
    // Publishes strInstallPath as the store's installation directory for this process.
    static bool publishInstallPath(const QString& strSettingsDir, const QString& strInstallPath);

    IPluginManager* GetPluginManager() override { return &m_pluginManager; }
    INovirTunnelClient* GetNovirTunnelClient() override { return m_pNovirTunnelClient; }
    IRelaySender* GetRelaySender() override { return &m_relaySender; }

private:
    QString m_strDataDir;
    HostPluginManager m_pluginManager;
    HostRelaySender m_relaySender;
    std::unique_ptr<PluginServerInfo> m_serverInfo;
    std::unique_ptr<BookmarkPlugin> m_bookmarkPlugin;
    struct RemoteServer
    {
        HostPluginManager pluginManager;
        std::unique_ptr<BookmarkPlugin> bookmarkPlugin;
    };
    std::map<QString, std::unique_ptr<RemoteServer>> m_remoteServers;
    INovirTunnelClient* m_pNovirTunnelClient = nullptr; // borrowed
    std::unique_ptr<QPluginLoader> m_loader;
    QPointer<IPluginObjectBase> m_plugin;
    QThreadPool m_requestPool;
};
