#pragma once
// The host's registry of plug-in objects. Valid for the plug-in's life; not owned by it.
// Callable from any thread.

#include <QObject>
#include <QString>

class IPluginManager
{
public:
    // Connects a signal of the plug-in object registered under strPluginId to a slot of
    // receiver. Signatures carry Qt's "2" (signal) and "1" (slot) prefixes, as SIGNAL()
    // and SLOT() produce them. Returns true when connected.
    virtual bool ConnectPluginSignal(const QString& strPluginId, const char* signal, const QObject* receiver,
                                     const char* method, int connectionType) = 0;
    // The plug-in object registered under strPluginId, or null.
    virtual QObject* GetPluginObject(const QString& strPluginId) = 0;

protected:
    ~IPluginManager() = default;
};
