#pragma once
// Simulated cameras for tests, the demo and the benchmarks.
//
// Contract:
// - start() creates one HTTP(S) server per camera on 127.0.0.1, each on its own ephemeral port,
//   all on one thread owned by the simulator (so the cameras never share the caller's event loop
//   and their work does not count as the caller's CPU time). Nothing listens beyond loopback.
// - Every camera requires its user and password (basic, or digest when asked). Protected cameras
//   answer object metadata only with a valid access token (Zelto, checked against the pair tokens
//   they handed out) and 403 otherwise.
// - The switches (slow, failing, malformed) and the queries may be used from any thread.
// - The directory records carry the keys of the camera directory: "Name", "IP", "Port", "User",
//   "Password" (hexadecimal text of the Latin-1 bytes), "UseSSL", "DelvixProtect",
//   "MultiChannelID" (channels of a multi-channel camera only), "Location", "GroupID",
//   "IsRecording".
// - Failures are values: start() returns false with a reason and leaves nothing listening.

#include "CameraSetup.h"
#include "ObjectGenerator.h"
#include "Zelto.h"

#include <QList>
#include <QMutex>
#include <QObject>
#include <QVariantMap>
#include <functional>
#include <memory>

class QThread;
class SimulatedCamera;

class CameraSimulator : public QObject
{
    Q_OBJECT

public:
    explicit CameraSimulator(quint64 seed = 1, QObject* parent = nullptr);
    // Cameras whose attribute codes come from a site's vocabulary.
    CameraSimulator(quint64 seed, const AttributeVocabulary& vocabulary, QObject* parent = nullptr);
    ~CameraSimulator() override;

    // The cameras' clock for checking access tokens (default: the system clock). Set before start().
    void setClock(Zelto::Clock clock) { m_tokenOptions.clock = std::move(clock); }
    bool start(const QList<CameraSetup>& cameras, QString* error = nullptr);
    void stop();

    quint16 port(const QString& camera) const;
    // Answers after delayMs of silence; streaming: at once, in eight parts delayMs apart.
    void setSlow(const QString& camera, int delayMs, bool streaming = false);
    void setFailing(const QString& camera, bool failing);
    void setMalformed(const QString& camera, bool malformed);
    QStringList issuedPairTokens(const QString& camera) const;

    // The most recent requests the cameras answered, oldest first: at most kServedKept, so that a
    // site that runs for months keeps a bounded log.
    static constexpr qsizetype kServedKept = 4096;
    QList<ServedRequest> servedRequests() const;
    void clearServedRequests();

    // Directory records: one per single-channel camera, one per channel ("<name>-c<index>") of a
    // multi-channel camera. Keyed by "Name".
    QVariantMap directoryMap() const;
    QVariantMap directoryRecord(const QString& camera, int channel = -1) const;

    const ObjectGenerator& generator() const { return m_generator; }
    // Runs work on the cameras' thread and waits for it (benchmarks read that thread's CPU time).
    void runOnCameraThread(const std::function<void()>& work);

private:
    SimulatedCamera* find(const QString& camera) const;

    const ObjectGenerator m_generator;
    Zelto::ManagerOptions m_tokenOptions;
    std::unique_ptr<QThread> m_thread;
    QObject* m_context = nullptr;      // lives on m_thread, runs start/stop work there; owned
    QList<SimulatedCamera*> m_cameras; // live on m_thread; written by start/stop only
    mutable QMutex m_mutex;
    QList<ServedRequest> m_served; // guarded by m_mutex (written on the camera thread)
};
