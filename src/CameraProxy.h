#pragma once
// The plug-in's only road to the cameras' own HTTP interface. Takes one request map per camera
// and time window, lets one object-metadata request per camera be outstanding while later ones
// wait in that camera's queue, and announces each answer by a signal. Also carries the pair-token
// request, which bypasses the queues.
//
// Thread: everything, including the HTTP client's completion functions, runs on the thread that
// owns the proxy; it takes no locks. A completion that arrives after the proxy is gone is ignored.

#include "IBraskHTTPClient.h"

#include <QMap>
#include <QNetworkReply>
#include <QObject>
#include <QQueue>
#include <QSet>
#include <QString>
#include <QVariantMap>
#include <memory>

class CameraProxy : public QObject
{
    Q_OBJECT

public:
    static constexpr unsigned int kDefaultTimeoutMs = 30000;

    CameraProxy();
    explicit CameraProxy(std::shared_ptr<IBraskHTTPClient> httpClient);
    ~CameraProxy() override;

    // Composes the request in place ("path" added, "password" decoded) and sends it now, or queues
    // it behind the camera's outstanding request. With dropCovered, a request whose window ends
    // before the last queued one of that camera is dropped.
    virtual void sendRequest(QVariantMap& request, bool dropCovered);
    // Asks the camera of the record for a pair token, at once.
    virtual void sendPairTokenRequest(const QVariantMap& cameraRecord);

    QVariantMap composePairTokenRequest(const QVariantMap& cameraRecord) const;

    // Limit of every exchange; tests shorten it.
    void setRequestTimeoutMs(unsigned int timeoutMs) { m_timeoutMs = timeoutMs; }

signals:
    // lastSyncTime is the request's own end time; data holds "data" (the body) and "count".
    void receiveObjectMeta(const QString& cameraID, unsigned int lastSyncTime, const QVariantMap& data);
    void receivePairToken(const QString& cameraID, const QString& pairToken);
    void requestFailed(const QString& cameraID);

private:
    void composeRequest(QVariantMap& request);
    void sendHttpRequest(const QVariantMap& request);
    void handleHttpResponse(const QVariantMap& request, QNetworkReply::NetworkError error,
                            const QByteArray& body, bool flag);
    static bool isWithinPendingTimeRange(const QQueue<QVariantMap>& queue,
                                         const unsigned long long& endTimestamp);
    void sendPairTokenHttpRequest(const QVariantMap& request);
    void handlePairTokenHttpResponse(const QVariantMap& request, QNetworkReply::NetworkError error,
                                     const QByteArray& body, bool flag);
    // Get with a completion that reaches `handler` only while this proxy lives.
    void get(const QVariantMap& request,
             void (CameraProxy::*handler)(const QVariantMap&, QNetworkReply::NetworkError, const QByteArray&,
                                          bool));

    std::shared_ptr<IBraskHTTPClient> m_httpClient;
    // Per camera ID: composed requests waiting behind the one in flight. Entries stay once made.
    QMap<QString, QQueue<QVariantMap>> m_pendingRequests;
    QSet<QString> m_inFlight; // camera IDs with an object-metadata request outstanding
    unsigned int m_timeoutMs = kDefaultTimeoutMs;
    // Completion functions hold a weak reference; it expires first thing in the destructor, so a
    // completion run while the client is being torn down (or later) leaves the proxy alone.
    std::shared_ptr<CameraProxy*> m_self;
};
