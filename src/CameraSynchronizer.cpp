#include "CameraSynchronizer.h"

#include "LogFacility.h"

#include <QDateTime>
#include <QFile>
#include <QPointer>
#include <QTextStream>
#include <QThread>
#include <QTimerEvent>
#include <climits>

namespace {

const QString kRoutineSyncFile = QStringLiteral("routineSyncTimeBuffer.txt");
const QString kObjectDataDelayFile = QStringLiteral("getObjectDataTimeBuffer.txt");
constexpr qint64 kCatchUpLimitSecond = 3600;

// The last line of a settings file; false when the file cannot be opened.
bool readLastLine(const QString& fileName, QString* line)
{
    QFile file(fileName);
    if (!file.open(QIODevice::ReadOnly | QIODevice::Text)) {
        return false;
    }
    QTextStream stream(&file);
    while (!stream.atEnd()) {
        *line = stream.readLine();
    }
    return true;
}

} // namespace

CameraSynchronizer::CameraSynchronizer()
    : CameraSynchronizer(std::make_shared<CameraProxy>())
{}

CameraSynchronizer::CameraSynchronizer(std::shared_ptr<CameraProxy> proxy)
    : CameraSynchronizer(std::move(proxy), Clock())
{}

CameraSynchronizer::CameraSynchronizer(std::shared_ptr<CameraProxy> proxy, Clock clock)
    : QObject(nullptr)
    , m_cameraProxy(std::move(proxy))
    , m_clock(clock ? std::move(clock) : Clock([] { return QDateTime::currentMSecsSinceEpoch(); }))
{
    setTokenConverter(std::make_shared<TokenConverter>());
    connectProxy(m_cameraProxy.get());
    setRoutineSyncPeriodSecond();
    setDelayGetObjectDataSecond();
    m_timerId = startTimer(timerIntervalMs(), Qt::VeryCoarseTimer);
}

CameraSynchronizer::~CameraSynchronizer() = default;

void CameraSynchronizer::connectProxy(CameraProxy* proxy)
{
    if (!proxy) {
        return;
    }
    connect(proxy, &CameraProxy::receiveObjectMeta, this, &CameraSynchronizer::receiveObjectMeta);
    connect(proxy, &CameraProxy::receivePairToken, this, &CameraSynchronizer::receivePairToken);
}

qint64 CameraSynchronizer::nowSecond() const
{
    return m_clock() / 1000;
}

void CameraSynchronizer::setRoutineSyncPeriodSecond()
{
    QString line;
    if (!readLastLine(kRoutineSyncFile, &line)) {
        m_routineSyncPeriodSecond = kDefaultRoutineSyncPeriodSecond;
        return;
    }
    const int period = line.toInt(nullptr, 10);
    // A period of 0 or less would make the timer spin and the window loop never end; one past
    // INT_MAX/1000 would overflow the timer interval.
    if (period <= 0 || period > INT_MAX / 1000) {
        DELVIX_LOG(LogFacility::LevelError, "%s, routine sync period \"%s\" is not usable, using %d s",
                   "CameraSynchronizer::setRoutineSyncPeriodSecond", qPrintable(line),
                   kDefaultRoutineSyncPeriodSecond);
        m_routineSyncPeriodSecond = kDefaultRoutineSyncPeriodSecond;
        return;
    }
    m_routineSyncPeriodSecond = period;
}

void CameraSynchronizer::setDelayGetObjectDataSecond()
{
    QString line;
    if (!readLastLine(kObjectDataDelayFile, &line)) {
        m_delayGetObjectDataSecond = kDefaultDelayGetObjectDataSecond;
        return;
    }
    const unsigned int delay = line.toUInt(nullptr, 10);
    // A delay beyond the present would put every window before 1970 and wrap the times.
    if (qint64(delay) > nowSecond()) {
        DELVIX_LOG(LogFacility::LevelError, "%s, object data delay \"%s\" is not usable, using %u s",
                   "CameraSynchronizer::setDelayGetObjectDataSecond", qPrintable(line),
                   kDefaultDelayGetObjectDataSecond);
        m_delayGetObjectDataSecond = kDefaultDelayGetObjectDataSecond;
        return;
    }
    m_delayGetObjectDataSecond = delay;
}

void CameraSynchronizer::timerEvent(QTimerEvent* event)
{
    if (event->timerId() == m_timerId) {
        synchronize();
        return;
    }
    QObject::timerEvent(event);
}

void CameraSynchronizer::updateInformation(const QVariantMap& cameras)
{
    if (cameras == m_camerasMap) {
        return;
    }
    m_camerasMap = cameras;
    updatePairTokenMap(true);
}

void CameraSynchronizer::updateLastSync(const QVariantMap& lastSync)
{
    m_lastSyncMap = lastSync;
}

void CameraSynchronizer::removeCameraLastSync(const QString& cameraID)
{
    m_lastSyncMap.remove(cameraID);
}

void CameraSynchronizer::setEnableDelvix(const QVariantMap& settings)
{
    m_enableDelvix = settings.value(QStringLiteral("enable")).toBool();
}

void CameraSynchronizer::setHttpClient(std::shared_ptr<CameraProxy> proxy)
{
    // The old proxy's late answers would name windows this synchroniser no longer tracks there.
    if (m_cameraProxy) {
        disconnect(m_cameraProxy.get(), nullptr, this, nullptr);
    }
    m_cameraProxy = std::move(proxy);
    connectProxy(m_cameraProxy.get());
}

void CameraSynchronizer::setTokenConverter(std::shared_ptr<TokenConverter> converter)
{
    m_tokenConverter = std::move(converter);
}

void CameraSynchronizer::updatePairTokenMap(bool force)
{
    if (force) {
        m_pairTokenMap.clear();
    }
    if (!m_cameraProxy) {
        return;
    }
    for (auto it = m_camerasMap.cbegin(); it != m_camerasMap.cend(); ++it) {
        const QVariantMap record = it.value().toMap();
        if (record.value(QStringLiteral("DelvixProtect")).toBool() &&
            !m_pairTokenMap.contains(record.value(QStringLiteral("Name")).toString())) {
            m_cameraProxy->sendPairTokenRequest(record);
        }
    }
}

QString CameraSynchronizer::accessTokenOf(const QString& name)
{
    if (!m_pairTokenMap.contains(name) || !m_tokenConverter) {
        return QString();
    }
    const std::string token =
        m_tokenConverter->genAccessToken(m_pairTokenMap.value(name).toString().toUtf8().toStdString());
    return QString::fromUtf8(token.data(), qsizetype(token.size()));
}

QVariantMap CameraSynchronizer::requestFor(const QVariantMap& record, qint64 start, qint64 end,
                                           const QString& accessToken) const
{
    QVariantMap request;
    request.insert(QStringLiteral("cameraID"), record.value(QStringLiteral("Name")).toString());
    request.insert(QStringLiteral("startTimestamp"), start);
    request.insert(QStringLiteral("endTimestamp"), end);
    request.insert(QStringLiteral("ip"), record.value(QStringLiteral("IP")).toString());
    request.insert(QStringLiteral("port"), record.value(QStringLiteral("Port")).toInt());
    request.insert(QStringLiteral("username"), record.value(QStringLiteral("User")).toString());
    request.insert(QStringLiteral("password"), record.value(QStringLiteral("Password")).toString());
    request.insert(QStringLiteral("useSSL"), record.value(QStringLiteral("UseSSL")).toBool());
    request.insert(QStringLiteral("accessToken"), accessToken);
    if (record.contains(QStringLiteral("MultiChannelID"))) {
        request.insert(QStringLiteral("multiChannelID"), record.value(QStringLiteral("MultiChannelID")));
    }
    return request;
}

void CameraSynchronizer::synchronize()
{
    if (!m_enableDelvix) {
        m_lastSyncMap.clear();
        return;
    }
    updatePairTokenMap(false);
    if (!m_cameraProxy) {
        return;
    }
    const qint64 period = m_routineSyncPeriodSecond;
    for (auto it = m_camerasMap.cbegin(); it != m_camerasMap.cend(); ++it) {
        const QVariantMap record = it.value().toMap();
        const QString name = record.value(QStringLiteral("Name")).toString();
        const QString accessToken = accessTokenOf(name);
        const qint64 now = nowSecond();
        // Checked on every pass too: the clock may have been set back since the file was read.
        const qint64 delay = qint64(m_delayGetObjectDataSecond) > now ? kDefaultDelayGetObjectDataSecond
                                                                      : m_delayGetObjectDataSecond;

        qint64 start =
            m_lastSyncMap.contains(name) ? qint64(m_lastSyncMap.value(name).toUInt()) : now - period - delay;
        start = qMax<qint64>(start, 0); // last-sync times are unsigned; nothing lies before 1970
        const qint64 limit = (now - start > kCatchUpLimitSecond) ? start + kCatchUpLimitSecond : now - delay;
        while (start < limit) {
            const qint64 end = qMin(start + period, now);
            QVariantMap request = requestFor(record, start, end, accessToken);
            m_cameraProxy->sendRequest(request, true);
            start += period;
        }
    }
}

void CameraSynchronizer::receiveObjectMeta(const QString& cameraName, unsigned int time,
                                           const QVariantMap& data)
{
    if (!m_camerasMap.contains(cameraName)) {
        return; // the camera left the directory meanwhile
    }
    const unsigned int last = m_lastSyncMap.value(cameraName).toUInt();
    if (!m_lastSyncMap.contains(cameraName) || last == 0 || last < time) {
        m_lastSyncMap.insert(cameraName, time);
    }
    emit receiveResponseData(m_camerasMap.value(cameraName).toMap(), time, data);
}

void CameraSynchronizer::receivePairToken(const QString& cameraName, const QString& pairToken)
{
    m_pairTokenMap.insert(cameraName, pairToken);
}

void CameraSynchronizer::retrieveDelvixData(const QString& cameraID, qint64 startTime, qint64 endTime)
{
    if (QThread::currentThread() != thread()) {
        // Requests arrive on host threads; the maps, the proxy's queues and the HTTP client belong
        // to this object's thread. Dropped if this object is gone before it runs.
        QMetaObject::invokeMethod(
            this,
            [this, cameraID, startTime, endTime]() { retrieveDelvixData(cameraID, startTime, endTime); },
            Qt::QueuedConnection);
        return;
    }
    if (!m_enableDelvix || !m_cameraProxy) {
        return;
    }
    const QVariantMap record = m_camerasMap.value(cameraID).toMap();
    if (record.isEmpty()) {
        return;
    }
    QVariantMap request = requestFor(record, startTime, endTime,
                                     accessTokenOf(record.value(QStringLiteral("Name")).toString()));
    m_cameraProxy->sendRequest(request, false);
}
