#include "PluginServerInfo.h"

PluginServerInfo::PluginServerInfo(const QString& strDatabasePath, QObject* parent)
    : QObject(parent)
    , m_strDatabasePath(strDatabasePath)
{}

QString PluginServerInfo::serverDatabasePath() const
{
    QMutexLocker lock(&m_mutex);
    return m_strDatabasePath;
}

void PluginServerInfo::setServerDatabasePath(const QString& strPath)
{
    {
        QMutexLocker lock(&m_mutex);
        if (m_strDatabasePath == strPath) {
            return;
        }
        m_strDatabasePath = strPath;
    }
    emit serverDatabasePathChanged(strPath);
}
