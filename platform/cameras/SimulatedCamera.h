#pragma once
// One simulated camera: an HTTP(S) server on a loopback port serving the object-metadata and
// pair-token paths. Lives on the simulator's thread; the switches may be set from any thread.

#include "CameraSetup.h"
#include "Zelto.h"

#include <QAbstractHttpServer>
#include <QMutex>
#include <QSet>
#include <QStringList>
#include <atomic>
#include <functional>

class ObjectGenerator;
class QTcpSocket;

class SimulatedCamera : public QAbstractHttpServer
{
    Q_OBJECT

public:
    SimulatedCamera(const CameraSetup& setup, const ObjectGenerator* generator,
                    Zelto::ManagerOptions tokenOptions, std::function<void(const ServedRequest&)> onServed,
                    QObject* parent = nullptr);

    // Listens on 127.0.0.1 on an ephemeral port; false with a reason when it cannot.
    bool listenOnLoopback(QString* error);
    quint16 port() const { return m_port; }
    const CameraSetup& setup() const { return m_setup; }

    void setSlow(int delayMs, bool streaming)
    {
        m_slowMs = delayMs;
        m_streaming = streaming;
    }
    void setFailing(bool failing) { m_failing = failing; }
    void setMalformed(bool malformed) { m_malformed = malformed; }
    QStringList issuedPairTokens() const;

protected:
    bool handleRequest(const QHttpServerRequest& request, QTcpSocket* socket) override;
    void missingHandler(const QHttpServerRequest& request, QTcpSocket* socket) override;

private:
    struct Answer
    {
        int status = 200;
        QByteArray contentType = "application/json";
        QByteArray body;
        QByteArray extraHeaders;
    };
    bool authorised(const QHttpServerRequest& request) const;
    bool digestAuthorised(const QByteArray& header) const;
    Answer challenge();
    void send(QTcpSocket* socket, const Answer& answer);
    static QByteArray encoded(const Answer& answer);

    const CameraSetup m_setup;
    const ObjectGenerator* m_generator; // owned by the simulator, outlives every camera
    const Zelto::ManagerOptions m_tokenOptions;
    const std::function<void(const ServedRequest&)> m_onServed;
    quint16 m_port = 0;
    std::atomic<int> m_slowMs{0};
    std::atomic<bool> m_streaming{false};
    std::atomic<bool> m_failing{false};
    std::atomic<bool> m_malformed{false};
    mutable QMutex m_mutex;
    QStringList m_pairTokens;  // guarded by m_mutex; newest last, a few kept
    QSet<QByteArray> m_nonces; // digest nonces handed out; camera thread only
};
