#pragma once
// The in-process host's registry of plug-in objects, by identifier. Objects are borrowed:
// whoever registers one keeps it alive while it is registered. Thread-safe.

#include "IPluginManager.h"

#include <QHash>
#include <QMutex>
#include <QPointer>

class HostPluginManager : public IPluginManager
{
public:
    void registerPluginObject(const QString& strPluginId, QObject* object);
    void unregisterPluginObject(const QString& strPluginId);

    bool ConnectPluginSignal(const QString& strPluginId, const char* signal, const QObject* receiver,
                             const char* method, int connectionType) override;
    QObject* GetPluginObject(const QString& strPluginId) override;

private:
    QMutex m_mutex;                              // guards m_objects
    QHash<QString, QPointer<QObject>> m_objects; // guarded by m_mutex
};
