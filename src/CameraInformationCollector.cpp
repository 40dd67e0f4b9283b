#include "CameraInformationCollector.h"

#include "IFrameworkTools.h"
#include "LogFacility.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QMutexLocker>
#include <limits>

namespace {

const QString kKeyLocation = QStringLiteral("Location");
const QString kKeyIsRecording = QStringLiteral("IsRecording");
const QString kKeyObjectMetaInfo = QStringLiteral("ObjectMetaInfo");
const QString kKeyId = QStringLiteral("ID");
const QString kKeyFaceThumbnail = QStringLiteral("FaceThumbnail");
const QString kKeyPlateThumbnail = QStringLiteral("LicensePlateThumbnail");
const QString kCmdInputObjectMetaInfo = QStringLiteral("InputObjectMetaInfo");

// An object's "ID" as a 64-bit integer, the way a variant converts it: numbers (integral part),
// numeric texts and booleans; anything else is 0. IDs above the signed range arrive as doubles
// and keep their unsigned value.
quint64 readObjectId(const QJsonValue& value)
{
    switch (value.type()) {
    case QJsonValue::Double: {
        const qint64 integer = value.toInteger(std::numeric_limits<qint64>::min());
        if (integer != std::numeric_limits<qint64>::min()) {
            return quint64(integer);
        }
        const double d = value.toDouble();
        if (d >= 9223372036854775808.0 && d < 18446744073709551616.0) {
            return quint64(d);
        }
        if (d > -9223372036854775808.0 && d < 9223372036854775808.0) {
            return quint64(qint64(d));
        }
        return 0;
    }
    case QJsonValue::String:
        return quint64(value.toString().toLongLong());
    case QJsonValue::Bool:
        return value.toBool() ? 1 : 0;
    default:
        return 0;
    }
}

// The info text goes into an XML element: a camera must not be able to end it early, forge
// elements, or make the message unreadable. "&", "<" and ">" become entities; U+FFFE and U+FFFF,
// which XML does not allow at all, can only stand inside JSON strings here and become their
// JSON escapes, which read back as the same text. Text without any of these stays
// byte-identical.
QByteArray escapeXmlText(const QByteArray& text)
{
    auto isNonCharacter = [&text](qsizetype i) {
        return quint8(text[i]) == 0xEF && i + 2 < text.size() && quint8(text[i + 1]) == 0xBF &&
               (quint8(text[i + 2]) == 0xBE || quint8(text[i + 2]) == 0xBF);
    };
    qsizetype extra = 0;
    for (qsizetype i = 0; i < text.size(); ++i) {
        const char c = text[i];
        extra += c == '&' ? 4 : (c == '<' || c == '>') ? 3 : isNonCharacter(i) ? 3 : 0;
    }
    if (extra == 0) {
        return text;
    }
    QByteArray escaped;
    escaped.reserve(text.size() + extra);
    for (qsizetype i = 0; i < text.size(); ++i) {
        const char c = text[i];
        if (c == '&') {
            escaped += "&amp;";
        } else if (c == '<') {
            escaped += "&lt;";
        } else if (c == '>') {
            escaped += "&gt;";
        } else if (isNonCharacter(i)) {
            escaped += quint8(text[i + 2]) == 0xBE ? "\\ufffe" : "\\uffff";
            i += 2;
        } else {
            escaped += c;
        }
    }
    return escaped;
}

} // namespace

CameraInformationCollector::CameraInformationCollector(IFrameworkTools* tools)
{
    // Created here, with every member in place, and its signals connected before it registers
    // with the client: the client may answer on its own thread at once (or a hasty one from
    // inside the registration), and an answer announced to no receiver would leave the
    // directory empty until the next change.
    m_tunnelControl.reset(new NOVIRSrvTunnelControl(tools ? tools->GetNovirTunnelClient() : nullptr,
                                                    [this](NOVIRSrvTunnelControl* control) {
                                                        handleCameraInformationChange(control);
                                                        handleLocationInformationChange(control);
                                                    }));
}

CameraInformationCollector::~CameraInformationCollector() = default;

QSharedPointer<NOVIRSrvTunnelControl> CameraInformationCollector::getNOVIRSrvTunnelControl() const
{
    return m_tunnelControl;
}

void CameraInformationCollector::handleCameraInformationChange(NOVIRSrvTunnelControl* control)
{
    connect(control, &NOVIRSrvTunnelControl::updateCameras, this, &CameraInformationCollector::updateCameras);
    connect(control, &NOVIRSrvTunnelControl::removeCamera, this, &CameraInformationCollector::removeCamera);
    connect(control, &NOVIRSrvTunnelControl::updateCamera, this, &CameraInformationCollector::updateCamera);
    connect(control, &NOVIRSrvTunnelControl::updateCameraStatus, this,
            &CameraInformationCollector::updateCameraStatus);
}

void CameraInformationCollector::handleLocationInformationChange(NOVIRSrvTunnelControl* control)
{
    connect(control, &NOVIRSrvTunnelControl::updateLocations, this,
            &CameraInformationCollector::queryLocations);
    connect(control, &NOVIRSrvTunnelControl::addLocation, this, &CameraInformationCollector::addLocation);
    connect(control, &NOVIRSrvTunnelControl::removeLocation, this,
            &CameraInformationCollector::removeLocation);
}

void CameraInformationCollector::updateSingleCameraInformation(const QString& name)
{
    const auto camera = m_cameraInformationMap.constFind(name);
    const auto location = m_locationMap.constFind(name);
    if (camera == m_cameraInformationMap.cend() || location == m_locationMap.cend() ||
        !m_cameraStatusMap.value(name).toBool()) {
        return;
    }
    QVariantMap record = camera->toMap();
    const QVariantMap locationRecord = location->toMap();
    for (auto it = locationRecord.cbegin(); it != locationRecord.cend(); ++it) {
        record.insert(it.key(), it.value()); // the location's value wins
    }
    m_cameraDirectoryMap.insert(name, record);
}

void CameraInformationCollector::updateAllCamerasInformation()
{
    m_cameraDirectoryMap.clear();
    for (auto it = m_cameraInformationMap.cbegin(); it != m_cameraInformationMap.cend(); ++it) {
        updateSingleCameraInformation(it.key());
    }
}

void CameraInformationCollector::emitCameraInformationChanged()
{
    {
        QMutexLocker locker(&m_indexMutex);
        m_announcedDirectory = m_cameraDirectoryMap;
    }
    emit cameraInformationChanged(m_cameraDirectoryMap);
}

void CameraInformationCollector::rebuildLocationIndex()
{
    QHash<QString, QString> index;
    index.reserve(m_locationMap.size());
    for (auto it = m_locationMap.cbegin(); it != m_locationMap.cend(); ++it) {
        // Ascending walk: a location carried by two cameras resolves to the first name.
        const QString location = it.value().toMap().value(kKeyLocation).toString();
        if (!index.contains(location)) {
            index.insert(location, it.key());
        }
    }
    QMutexLocker locker(&m_indexMutex);
    m_locationIndex.swap(index);
}

void CameraInformationCollector::updateCameras(const QVariantMap& cameras)
{
    m_cameraInformationMap = cameras;
    updateAllCamerasInformation();
    emitCameraInformationChanged();
}

void CameraInformationCollector::removeCamera(const QString& name)
{
    m_cameraInformationMap.remove(name);
    m_cameraDirectoryMap.remove(name);
    emitCameraInformationChanged();
}

void CameraInformationCollector::updateCamera(const QString& name, const QVariantMap& record)
{
    m_cameraInformationMap.insert(name, record);
    updateSingleCameraInformation(name);
    emitCameraInformationChanged();
}

void CameraInformationCollector::updateCameraStatus(const QString& name, bool online)
{
    if (!online) {
        emit cameraDisconnected(name);
    }
    m_cameraStatusMap.insert(name, online);
    m_cameraDirectoryMap.remove(name);
    updateSingleCameraInformation(name);
    emitCameraInformationChanged();
}

void CameraInformationCollector::queryLocations(const QVariantMap& locations)
{
    m_locationMap = locations;
    rebuildLocationIndex();
    updateAllCamerasInformation();
    emitCameraInformationChanged();
}

void CameraInformationCollector::addLocation(const QString& name, const QVariantMap& record)
{
    m_locationMap.insert(name, record);
    rebuildLocationIndex();
    updateSingleCameraInformation(name);
    emitCameraInformationChanged();
}

void CameraInformationCollector::removeLocation(const QString& name)
{
    QVariantMap record = m_locationMap.value(name).toMap();
    record.insert(kKeyIsRecording, false);
    m_locationMap.insert(name, record);
    rebuildLocationIndex();
    m_cameraDirectoryMap.remove(name);
    emit locationRemoved(name);
    emitCameraInformationChanged();
}

void CameraInformationCollector::setDelvixSettings(const QVariantMap& settings)
{
    m_bFaceThumbnail = settings.value(QStringLiteral("faceEnable")).toBool();
    m_bPlateThumbnail = settings.value(QStringLiteral("LPREnable")).toBool();
}

QString CameraInformationCollector::getCameraNodeID(const QString& location)
{
    QHash<QString, QString> index;
    {
        QMutexLocker locker(&m_indexMutex);
        index = m_locationIndex; // shares the data; the lookup runs without the lock
    }
    return index.value(location);
}

QVariantMap CameraInformationCollector::cameraDirectory() const
{
    QMutexLocker locker(&m_indexMutex);
    return m_announcedDirectory;
}

void CameraInformationCollector::writeData(int groupID, int locationID, const QString& data)
{
    // Parsed from UTF-8: the text may carry any script (plates, names).
    QJsonObject root = QJsonDocument::fromJson(data.toUtf8()).object();
    QJsonArray objects = root.value(kKeyObjectMetaInfo).toArray();
    if (objects.isEmpty()) {
        return;
    }
    const bool keepFace = m_bFaceThumbnail;
    const bool keepPlate = m_bPlateThumbnail;
    quint64 startTime = std::numeric_limits<quint64>::max();
    quint64 endTime = 0;
    for (qsizetype i = 0; i < objects.size(); ++i) {
        const QJsonValue element = objects.at(i);
        QJsonObject object = element.toObject();
        bool changed = !element.isObject();
        const auto id = object.constFind(kKeyId);
        quint64 value = 0;
        if (id == object.constEnd()) {
            object.insert(kKeyId, QJsonValue::Null);
            changed = true;
        } else {
            value = readObjectId(id.value());
        }
        startTime = qMin(startTime, value);
        endTime = qMax(endTime, value);
        if (!keepFace && object.contains(kKeyFaceThumbnail)) {
            object.remove(kKeyFaceThumbnail);
            changed = true;
        }
        if (!keepPlate && object.contains(kKeyPlateThumbnail)) {
            object.remove(kKeyPlateThumbnail);
            changed = true;
        }
        if (changed) {
            objects.replace(i, object);
        }
    }
    root.insert(kKeyObjectMetaInfo, objects);
    const QByteArray info = escapeXmlText(QJsonDocument(root).toJson(QJsonDocument::Compact));

    // Filled in one pass: a "%1" inside the info text is data, never a placeholder.
    QString content;
    content.reserve(info.size() + 200);
    content += QLatin1String("<InputObjectMetaInfo><GroupID>");
    content += QString::number(groupID);
    content += QLatin1String("</GroupID><LocationID>");
    content += QString::number(locationID);
    content += QLatin1String("</LocationID><StartTime>");
    content += QString::number(startTime);
    content += QLatin1String("</StartTime><EndTime>");
    content += QString::number(endTime);
    content += QLatin1String("</EndTime><Info>");
    content += QString::fromUtf8(info);
    content += QLatin1String("</Info></InputObjectMetaInfo>");

    const bool sent =
        m_tunnelControl->sendRequest(m_tunnelControl->getServerAccountID(), kCmdInputObjectMetaInfo, content,
                                     QString(), nullptr, NSNovirTunnelClient::ConfigServer);
    if (!sent) {
        DELVIX_LOG(LogFacility::LevelError, "%s, send request (%s) failed, group %d, location %d",
                   "CameraInformationCollector::writeData", qPrintable(kCmdInputObjectMetaInfo), groupID,
                   locationID);
    }
}
