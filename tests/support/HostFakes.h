#pragma once
// Stand-ins for what the host hands the plug-in: the framework tools, a camera directory and an
// HTTP client whose calls the test completes. Header-only; tests that use them link the plug-in core.

#include "IBraskHTTPClient.h"
#include "ICameraInformationCollector.h"
#include "IFrameworkTools.h"

#include <QHash>
#include <QList>
#include <QMutex>
#include <QStringList>

// Framework tools that hand out what the test gives them (null for what it does not).
class TestTools final : public IFrameworkTools
{
public:
    explicit TestTools(IPluginManager* manager = nullptr, INovirTunnelClient* tunnel = nullptr,
                       IRelaySender* relay = nullptr)
        : m_manager(manager)
        , m_tunnel(tunnel)
        , m_relay(relay)
    {}
    IPluginManager* GetPluginManager() override { return m_manager; }
    INovirTunnelClient* GetNovirTunnelClient() override { return m_tunnel; }
    IRelaySender* GetRelaySender() override { return m_relay; }

private:
    IPluginManager* m_manager;
    INovirTunnelClient* m_tunnel;
    IRelaySender* m_relay;
};

// A camera directory fixed by the test (location id -> camera name, set before use), recording the
// metadata and settings handed to it. getCameraNodeID may be called from several threads.
class FakeCollector : public ICameraInformationCollector
{
public:
    void writeData(int groupID, int locationID, const QString& data) override
    {
        QMutexLocker lock(&m_mutex);
        m_writes << QStringLiteral("%1/%2 %3").arg(groupID).arg(locationID).arg(data);
    }
    void setDelvixSettings(const QVariantMap& settings) override
    {
        QMutexLocker lock(&m_mutex);
        m_settings = settings;
    }
    QString getCameraNodeID(const QString& location) override { return cameras.value(location); }
    QStringList writes() const // each as "group/location data"
    {
        QMutexLocker lock(&m_mutex);
        return m_writes;
    }
    QVariantMap settings() const
    {
        QMutexLocker lock(&m_mutex);
        return m_settings;
    }

    QHash<QString, QString> cameras; // read-only once searches run

private:
    mutable QMutex m_mutex;
    QStringList m_writes;   // guarded by m_mutex
    QVariantMap m_settings; // guarded by m_mutex
};

// An HTTP client that only records calls; the test decides when and how each one completes.
// Used from the test's thread only.
class RecordingHttpClient : public IBraskHTTPClient
{
public:
    struct Call
    {
        QString text;          // "user:password@host:port[ ssl] path"
        Completion completion; // empty once completed
    };
    bool Get(const QString& host, const QString& path, quint16 port, bool useSSL, const QString& user,
             const QString& password, Completion completion, unsigned int, const QList<QString>&) override
    {
        const QString ssl = useSSL ? QStringLiteral(" ssl") : QString();
        paths << path;
        calls.append({QStringLiteral("%1:%2@%3:%4%5 %6").arg(user, password, host).arg(port).arg(ssl, path),
                      std::move(completion)});
        return true;
    }
    // Completes call `index`, once.
    void complete(int index, QNetworkReply::NetworkError error, const QByteArray& body)
    {
        if (Completion completion = std::exchange(calls[index].completion, nullptr)) {
            completion(error, QByteArray(), body, false);
        }
    }
    QList<Call> calls;
    QStringList paths; // of every call, in order
};
