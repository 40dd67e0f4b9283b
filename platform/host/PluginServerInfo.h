#pragma once
// The host's server-information plug-in: tells where the server keeps its databases and
// announces when that changes. Lives on the host's main thread.

#include <QMutex>
#include <QObject>
#include <QString>

class PluginServerInfo : public QObject
{
    Q_OBJECT
public:
    static const char* pluginId() { return "3CE573D25E0F455B8F75EDDC573E2B64"; }

    explicit PluginServerInfo(const QString& strDatabasePath, QObject* parent = nullptr);

    Q_INVOKABLE QString serverDatabasePath() const;
    // Changes the path and emits serverDatabasePathChanged when it differs.
    void setServerDatabasePath(const QString& strPath);

signals:
    void serverDatabasePathChanged(const QString& path);

private:
    mutable QMutex m_mutex; // guards m_strDatabasePath
    QString m_strDatabasePath;
};
