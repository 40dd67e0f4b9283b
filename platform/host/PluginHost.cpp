#include "PluginHost.h"

#include "HostCallbacks.h"

#include <QCoreApplication>
#include <QDir>
#include <QFile>
#include <QFileInfo>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QSettings>

PluginHost::PluginHost(const QString& strDataDir, QObject* parent)
    : QObject(parent)
    , m_strDataDir(QFileInfo(strDataDir).absoluteFilePath())
{
    registerHostMetaTypes();
    QDir().mkpath(m_strDataDir);
    const QString databasePath = QDir(m_strDataDir).filePath(QStringLiteral("database"));
    QDir().mkpath(databasePath);
    m_serverInfo = std::make_unique<PluginServerInfo>(databasePath);
    m_pluginManager.registerPluginObject(QString::fromLatin1(PluginServerInfo::pluginId()),
                                         m_serverInfo.get());
    m_bookmarkPlugin =
        std::make_unique<BookmarkPlugin>(QDir(m_strDataDir).filePath(QStringLiteral("bookmarks.json")));
    m_pluginManager.registerPluginObject(QString::fromLatin1(BookmarkPlugin::pluginId()),
                                         m_bookmarkPlugin.get());
    publishInstallPath(QDir(m_strDataDir).filePath(QStringLiteral("config")), m_strDataDir);

    QFile config(QDir(m_strDataDir).filePath(QStringLiteral("host.json")));
    if (config.open(QIODevice::ReadOnly)) {
        const QJsonArray remotes = QJsonDocument::fromJson(config.readAll())
                                       .object()
                                       .value(QStringLiteral("remoteServers"))
                                       .toArray();
        for (const QJsonValue& remote : remotes) {
            if (!remote.toString().isEmpty()) {
                addRemoteServer(remote.toString());
            }
        }
    }
    // Several requests at once, as the management server delivers them.
    m_requestPool.setMaxThreadCount(4);
}

PluginHost::~PluginHost()
{
    unload();
    m_pluginManager.unregisterPluginObject(QString::fromLatin1(PluginServerInfo::pluginId()));
    m_pluginManager.unregisterPluginObject(QString::fromLatin1(BookmarkPlugin::pluginId()));
    for (const auto& remote : m_remoteServers) {
        m_relaySender.removeRemoteServer(remote.first);
    }
}

BookmarkPlugin& PluginHost::addRemoteServer(const QString& strRelayPath)
{
    auto& remote = m_remoteServers[strRelayPath];
    if (!remote) {
        remote = std::make_unique<RemoteServer>();
        // The relay path may hold characters a folder name cannot; the folder is only storage.
        const QString folder = QString::fromLatin1(strRelayPath.toUtf8().toHex());
        remote->bookmarkPlugin = std::make_unique<BookmarkPlugin>(
            QDir(m_strDataDir).filePath(QStringLiteral("remotes/%1/bookmarks.json").arg(folder)));
        remote->pluginManager.registerPluginObject(QString::fromLatin1(BookmarkPlugin::pluginId()),
                                                   remote->bookmarkPlugin.get());
        m_relaySender.addRemoteServer(strRelayPath, &remote->pluginManager);
    }
    return *remote->bookmarkPlugin;
}

BookmarkPlugin* PluginHost::remoteBookmarkPlugin(const QString& strRelayPath) const
{
    const auto it = m_remoteServers.find(strRelayPath);
    return it == m_remoteServers.end() ? nullptr : it->second->bookmarkPlugin.get();
}

bool PluginHost::publishInstallPath(const QString& strSettingsDir, const QString& strInstallPath)
{
    // The plug-in reads the machine-wide settings of "Quorvex, Inc."/"NOVIR"; point the
    // process's system scope at our data folder so the host, not the machine, decides.
    QSettings::setPath(QSettings::NativeFormat, QSettings::SystemScope, strSettingsDir);
    QSettings settings(QSettings::NativeFormat, QSettings::SystemScope, QStringLiteral("Quorvex, Inc."),
                       QStringLiteral("NOVIR"));
    settings.setValue(QStringLiteral("Software/INSTALL_PATH"), QDir::toNativeSeparators(strInstallPath));
    settings.sync();
    return settings.status() == QSettings::NoError;
}

QString PluginHost::defaultModulePath()
{
    const QDir binDir(QCoreApplication::applicationDirPath());
    return binDir.absoluteFilePath(QStringLiteral("../plugins/libPluginDelvixSrv.so"));
}

bool PluginHost::load(const QString& strModulePath, QString* error)
{
    auto fail = [error](const QString& message) {
        if (error) {
            *error = message;
        }
        return false;
    };
    if (m_plugin) {
        return fail(QStringLiteral("a plug-in is already loaded"));
    }
    if (!QFileInfo::exists(strModulePath)) {
        return fail(QStringLiteral("plug-in module not found: %1").arg(strModulePath));
    }
    auto loader = std::make_unique<QPluginLoader>(strModulePath);
    const QJsonObject metaData = loader->metaData();
    if (metaData.isEmpty()) {
        return fail(QStringLiteral("%1 is not a Qt plug-in: %2").arg(strModulePath, loader->errorString()));
    }
    const QString iid = metaData.value(QStringLiteral("IID")).toString();
    if (iid != QLatin1String(IPluginObjectBase_iid)) {
        return fail(QStringLiteral("%1 has interface id \"%2\", expected \"%3\"")
                        .arg(strModulePath, iid, QLatin1String(IPluginObjectBase_iid)));
    }
    const QString pluginId =
        metaData.value(QStringLiteral("MetaData")).toObject().value(QStringLiteral("PluginID")).toString();
    if (pluginId != QLatin1String(kExpectedPluginId)) {
        return fail(QStringLiteral("%1 has PluginID \"%2\", expected \"%3\"")
                        .arg(strModulePath, pluginId, QLatin1String(kExpectedPluginId)));
    }
    QObject* instance = loader->instance();
    auto* plugin = qobject_cast<IPluginObjectBase*>(instance);
    if (!plugin) {
        return fail(
            QStringLiteral("%1 could not be instantiated: %2").arg(strModulePath, loader->errorString()));
    }
    m_loader = std::move(loader);
    m_plugin = plugin;
    m_plugin->InitialPluginBase(this);
    m_plugin->AllPluginLoaded();
    return true;
}

void PluginHost::request(const QString& strCommand, const QVariant& params,
                         const RequestSenderInfo& senderInfo, HDLR_DO_REQUEST_CB hdlrDoRequestCB)
{
    QPointer<IPluginObjectBase> plugin = m_plugin;
    m_requestPool.start([plugin, strCommand, params, senderInfo, hdlrDoRequestCB]() {
        if (plugin) {
            plugin->Request(strCommand, params, senderInfo, hdlrDoRequestCB);
        }
    });
}

void PluginHost::waitForRequests()
{
    m_requestPool.waitForDone();
}

void PluginHost::unload()
{
    m_requestPool.waitForDone();
    if (m_loader) {
        // Deletes the plug-in's root object, then unloads the module.
        m_loader->unload();
        m_loader.reset();
    }
    m_plugin.clear();
}
