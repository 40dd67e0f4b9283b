#include "CameraSimulator.h"

#include "SimulatedCamera.h"

#include <QThread>

CameraSimulator::CameraSimulator(quint64 seed, QObject* parent)
    : QObject(parent)
    , m_generator(seed)
{}

CameraSimulator::CameraSimulator(quint64 seed, const AttributeVocabulary& vocabulary, QObject* parent)
    : QObject(parent)
    , m_generator(seed, 40, 20, vocabulary)
{}

CameraSimulator::~CameraSimulator()
{
    stop();
    // The camera thread's last append is ordered before this by that thread's end, but inside
    // QtCore, where ThreadSanitizer cannot see it; emptying the list under the lock shows it.
    QMutexLocker lock(&m_mutex);
    m_served.clear();
}

bool CameraSimulator::start(const QList<CameraSetup>& cameras, QString* error)
{
    stop();
    m_thread = std::make_unique<QThread>();
    m_thread->setObjectName(QStringLiteral("camera simulator"));
    m_thread->start();

    bool ok = true;
    QString reason;
    int nextLocation = 1;
    m_context = new QObject;
    m_context->moveToThread(m_thread.get());
    // Created on the camera thread, so their sockets live there from the start.
    QMetaObject::invokeMethod(
        m_context,
        [&]() {
            for (CameraSetup setup : cameras) {
                if (setup.locationNumber == 0) {
                    setup.locationNumber = nextLocation;
                }
                nextLocation = qMax(nextLocation, setup.locationNumber) + 1;
                auto* camera = new SimulatedCamera(setup, &m_generator, m_tokenOptions,
                                                   [this](const ServedRequest& served) {
                                                       QMutexLocker lock(&m_mutex);
                                                       if (m_served.size() == kServedKept) {
                                                           m_served.removeFirst();
                                                       }
                                                       m_served.append(served);
                                                   });
                if (!camera->listenOnLoopback(&reason)) {
                    delete camera;
                    ok = false;
                    return;
                }
                m_cameras.append(camera);
            }
        },
        Qt::BlockingQueuedConnection);
    if (!ok) {
        if (error) {
            *error = reason;
        }
        stop();
    }
    return ok;
}

void CameraSimulator::stop()
{
    if (!m_thread) {
        return;
    }
    QList<SimulatedCamera*> cameras = std::exchange(m_cameras, {});
    QMetaObject::invokeMethod(
        m_context, [&cameras]() { qDeleteAll(cameras); }, Qt::BlockingQueuedConnection);
    m_thread->quit();
    m_thread->wait();
    // Its thread has ended, so it may go from here.
    delete m_context;
    m_context = nullptr;
    m_thread.reset();
}

void CameraSimulator::runOnCameraThread(const std::function<void()>& work)
{
    if (m_context) {
        QMetaObject::invokeMethod(m_context, work, Qt::BlockingQueuedConnection);
    }
}

SimulatedCamera* CameraSimulator::find(const QString& camera) const
{
    for (SimulatedCamera* c : m_cameras) {
        if (c->setup().name == camera) {
            return c;
        }
    }
    return nullptr;
}

quint16 CameraSimulator::port(const QString& camera) const
{
    SimulatedCamera* c = find(camera);
    return c ? c->port() : 0;
}

void CameraSimulator::setSlow(const QString& camera, int delayMs, bool streaming)
{
    if (SimulatedCamera* c = find(camera)) {
        c->setSlow(delayMs, streaming);
    }
}

void CameraSimulator::setFailing(const QString& camera, bool failing)
{
    if (SimulatedCamera* c = find(camera)) {
        c->setFailing(failing);
    }
}

void CameraSimulator::setMalformed(const QString& camera, bool malformed)
{
    if (SimulatedCamera* c = find(camera)) {
        c->setMalformed(malformed);
    }
}

QStringList CameraSimulator::issuedPairTokens(const QString& camera) const
{
    SimulatedCamera* c = find(camera);
    return c ? c->issuedPairTokens() : QStringList();
}

QList<ServedRequest> CameraSimulator::servedRequests() const
{
    QMutexLocker lock(&m_mutex);
    return m_served;
}

void CameraSimulator::clearServedRequests()
{
    QMutexLocker lock(&m_mutex);
    m_served.clear();
}

QVariantMap CameraSimulator::directoryRecord(const QString& camera, int channel) const
{
    SimulatedCamera* c = find(camera);
    if (!c) {
        return QVariantMap();
    }
    const CameraSetup& setup = c->setup();
    QVariantMap record;
    record.insert(QStringLiteral("Name"),
                  channel >= 0 ? setup.name + QStringLiteral("-c") + QString::number(channel) : setup.name);
    record.insert(QStringLiteral("IP"), QStringLiteral("127.0.0.1"));
    record.insert(QStringLiteral("Port"), int(c->port()));
    record.insert(QStringLiteral("User"), setup.user);
    record.insert(QStringLiteral("Password"), QString::fromLatin1(setup.password.toLatin1().toHex()));
    record.insert(QStringLiteral("UseSSL"), setup.useSSL);
    record.insert(QStringLiteral("DelvixProtect"), setup.protectedMetadata);
    if (channel >= 0) {
        record.insert(QStringLiteral("MultiChannelID"), QString::number(channel));
    }
    record.insert(QStringLiteral("Location"),
                  QStringLiteral("Loc") + QString::number(setup.locationNumber + qMax(0, channel) * 1000));
    record.insert(QStringLiteral("GroupID"), setup.groupID);
    record.insert(QStringLiteral("IsRecording"), true);
    return record;
}

QVariantMap CameraSimulator::directoryMap() const
{
    QVariantMap map;
    for (SimulatedCamera* c : m_cameras) {
        const CameraSetup& setup = c->setup();
        if (setup.channels > 1) {
            for (int channel = 0; channel < setup.channels; ++channel) {
                const QVariantMap record = directoryRecord(setup.name, channel);
                map.insert(record.value(QStringLiteral("Name")).toString(), record);
            }
        } else {
            map.insert(setup.name, directoryRecord(setup.name));
        }
    }
    return map;
}
