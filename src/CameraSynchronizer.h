#pragma once
// Keeps every known camera's object metadata flowing in. A timer makes one pass per routine sync
// period: for each camera of the directory map it asks the proxy for the windows not fetched yet,
// staying the object-data delay behind the present and catching up by at most an hour per pass.
// Each answer advances that camera's last-sync time and is passed on by receiveResponseData.
//
// Thread: the synchroniser, its proxy and token converter belong to the thread that creates it,
// which must run an event loop; nothing is locked. retrieveDelvixData may be called from any
// thread: it carries itself over to that one.

#include "CameraProxy.h"
#include "TokenConverter.h"

#include <QObject>
#include <QVariantMap>
#include <atomic>
#include <functional>
#include <memory>

class CameraSynchronizer : public QObject
{
    Q_OBJECT

public:
    // Milliseconds since 1970-01-01 UTC: where a pass reads "now".
    using Clock = std::function<qint64()>;

    static constexpr int kDefaultRoutineSyncPeriodSecond = 60;
    static constexpr unsigned int kDefaultDelayGetObjectDataSecond = 180;

    CameraSynchronizer();
    explicit CameraSynchronizer(std::shared_ptr<CameraProxy> proxy);
    CameraSynchronizer(std::shared_ptr<CameraProxy> proxy, Clock clock);
    ~CameraSynchronizer() override;

    virtual void updateInformation(const QVariantMap& cameras);
    virtual void updateLastSync(const QVariantMap& lastSync);
    virtual void removeCameraLastSync(const QString& cameraID);
    virtual void setEnableDelvix(const QVariantMap& settings);
    virtual void retrieveDelvixData(const QString& cameraID, qint64 startTime, qint64 endTime);

    void synchronize();
    QVariantMap getLastSyncMap() const { return m_lastSyncMap; }
    // Replaces the proxy used for sending; its answers are listened to from then on.
    void setHttpClient(std::shared_ptr<CameraProxy> proxy);
    void setTokenConverter(std::shared_ptr<TokenConverter> converter);

    int routineSyncPeriodSecond() const { return m_routineSyncPeriodSecond; }
    unsigned int delayGetObjectDataSecond() const { return m_delayGetObjectDataSecond; }
    int timerIntervalMs() const { return m_routineSyncPeriodSecond * 1000; }

public slots:
    void receiveObjectMeta(const QString& cameraName, unsigned int time, const QVariantMap& data);
    void receivePairToken(const QString& cameraName, const QString& pairToken);

signals:
    void receiveResponseData(const QVariantMap& cameraInfo, unsigned int time, const QVariantMap& data);

protected:
    void timerEvent(QTimerEvent* event) override;

private:
    void updatePairTokenMap(bool force);
    void setRoutineSyncPeriodSecond();
    void setDelayGetObjectDataSecond();
    void connectProxy(CameraProxy* proxy);
    QString accessTokenOf(const QString& name);
    QVariantMap requestFor(const QVariantMap& record, qint64 start, qint64 end,
                           const QString& accessToken) const;
    qint64 nowSecond() const;

    QVariantMap m_camerasMap; // camera name -> camera directory record
    std::shared_ptr<CameraProxy> m_cameraProxy;
    QVariantMap m_lastSyncMap; // camera ID -> unsigned 32-bit seconds: end of the latest fetched window
    std::shared_ptr<TokenConverter> m_tokenConverter;
    int m_routineSyncPeriodSecond = kDefaultRoutineSyncPeriodSecond;
    unsigned int m_delayGetObjectDataSecond = kDefaultDelayGetObjectDataSecond;
    std::atomic<bool> m_enableDelvix{true}; // the host may deliver settings on any thread
    QVariantMap m_pairTokenMap;             // camera ID -> pair token
    Clock m_clock;
    int m_timerId = 0;
};
