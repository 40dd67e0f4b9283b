#include "HostPluginManager.h"

void HostPluginManager::registerPluginObject(const QString& strPluginId, QObject* object)
{
    QMutexLocker lock(&m_mutex);
    m_objects.insert(strPluginId, object);
}

void HostPluginManager::unregisterPluginObject(const QString& strPluginId)
{
    QMutexLocker lock(&m_mutex);
    m_objects.remove(strPluginId);
}

bool HostPluginManager::ConnectPluginSignal(const QString& strPluginId, const char* signal,
                                            const QObject* receiver, const char* method, int connectionType)
{
    QObject* sender = GetPluginObject(strPluginId);
    if (!sender || !receiver || !signal || !method) {
        return false;
    }
    return static_cast<bool>(
        QObject::connect(sender, signal, receiver, method, static_cast<Qt::ConnectionType>(connectionType)));
}

QObject* HostPluginManager::GetPluginObject(const QString& strPluginId)
{
    QMutexLocker lock(&m_mutex);
    return m_objects.value(strPluginId).data();
}
