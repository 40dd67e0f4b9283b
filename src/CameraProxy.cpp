#include "CameraProxy.h"

#include "BraskHttpClient.h"
#include "LogFacility.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QUrl>

namespace {

const QString kCameraID = QStringLiteral("cameraID");
const QString kStartTimestamp = QStringLiteral("startTimestamp");
const QString kEndTimestamp = QStringLiteral("endTimestamp");
const QString kIp = QStringLiteral("ip");
const QString kPort = QStringLiteral("port");
const QString kUsername = QStringLiteral("username");
const QString kPassword = QStringLiteral("password");
const QString kUseSSL = QStringLiteral("useSSL");
const QString kAccessToken = QStringLiteral("accessToken");
const QString kMultiChannelID = QStringLiteral("multiChannelID");
const QString kPath = QStringLiteral("path");

// Camera passwords travel as hexadecimal text of their Latin-1 bytes (non-hex characters skipped).
QString decodePassword(const QVariant& hex)
{
    return QString::fromLatin1(QByteArray::fromHex(hex.toString().toLatin1()));
}

// A port outside 1..65535 would silently become another port when narrowed; 0 makes the client
// refuse the call instead.
quint16 portOf(const QVariant& value)
{
    bool ok = false;
    const int port = value.toInt(&ok);
    return (ok && port > 0 && port <= 65535) ? quint16(port) : quint16(0);
}

} // namespace

CameraProxy::CameraProxy()
    : CameraProxy(std::make_shared<BraskHttpClient>())
{}

CameraProxy::CameraProxy(std::shared_ptr<IBraskHTTPClient> httpClient)
    : QObject(nullptr)
    , m_httpClient(std::move(httpClient))
    , m_self(std::make_shared<CameraProxy*>(this))
{}

CameraProxy::~CameraProxy()
{
    m_self.reset();
}

void CameraProxy::composeRequest(QVariantMap& request)
{
    request.insert(kPassword, decodePassword(request.value(kPassword)));
    const QString end = request.value(kEndTimestamp).toString();
    const QString start = request.value(kStartTimestamp).toString();
    // Percent-encoded so that no token can change the meaning of the query; unreserved characters
    // stay as they are, so URL-safe tokens go out byte for byte.
    const QString token =
        QString::fromLatin1(QUrl::toPercentEncoding(request.value(kAccessToken).toString()));

    QString path = QStringLiteral("/VCA");
    if (request.contains(kMultiChannelID)) {
        path += QStringLiteral("/c%1").arg(
            QString::fromLatin1(QUrl::toPercentEncoding(request.value(kMultiChannelID).toString())));
    }
    if (token.isEmpty()) {
        path += QStringLiteral("/Data/DB/ObjectMeta?StartTime=%1&EndTime=%2&Info=127").arg(start, end);
    } else {
        path += QStringLiteral("/Data/DB/ObjMeta?accessToken=%1&StartTime=%2&EndTime=%3&Info=127")
                    .arg(token, start, end);
    }
    request.insert(kPath, path);
}

void CameraProxy::sendRequest(QVariantMap& request, bool dropCovered)
{
    const QString cameraID = request.value(kCameraID).toString();
    const unsigned long long end = request.value(kEndTimestamp).toULongLong();
    composeRequest(request);

    if (!m_inFlight.contains(cameraID)) {
        // Marked busy before sending, so a client that completes at once still finds it busy.
        m_inFlight.insert(cameraID);
        sendHttpRequest(request);
        return;
    }
    QQueue<QVariantMap>& queue = m_pendingRequests[cameraID];
    if (dropCovered && isWithinPendingTimeRange(queue, end)) {
        return; // the queue already reaches further
    }
    queue.enqueue(request);
}

bool CameraProxy::isWithinPendingTimeRange(const QQueue<QVariantMap>& queue,
                                           const unsigned long long& endTimestamp)
{
    return !queue.isEmpty() && queue.last().value(kEndTimestamp).toULongLong() > endTimestamp;
}

void CameraProxy::get(const QVariantMap& request,
                      void (CameraProxy::*handler)(const QVariantMap&, QNetworkReply::NetworkError,
                                                   const QByteArray&, bool))
{
    std::weak_ptr<CameraProxy*> self = m_self;
    const quint16 port = portOf(request.value(kPort));
    if (port == 0) { // the client refuses the call; its network error alone would not say why
        DELVIX_LOG(LogFacility::LevelError, "%s, camera %s has no usable port: %s", "CameraProxy::get",
                   qPrintable(request.value(kCameraID).toString()),
                   qPrintable(request.value(kPort).toString()));
    }
    m_httpClient->Get(
        request.value(kIp).toString(), request.value(kPath).toString(), port, request.value(kUseSSL).toBool(),
        request.value(kUsername).toString(), request.value(kPassword).toString(),
        [self, request, handler](QNetworkReply::NetworkError error, const QByteArray&, const QByteArray& body,
                                 bool flag) {
            if (const std::shared_ptr<CameraProxy*> proxy = self.lock()) {
                ((*proxy)->*handler)(request, error, body, flag);
            }
        },
        m_timeoutMs, QList<QString>());
}

void CameraProxy::sendHttpRequest(const QVariantMap& request)
{
    get(request, &CameraProxy::handleHttpResponse);
}

void CameraProxy::handleHttpResponse(const QVariantMap& request, QNetworkReply::NetworkError error,
                                     const QByteArray& body, bool)
{
    const QString cameraID = request.value(kCameraID).toString();
    QJsonParseError parseError;
    const QJsonDocument document = QJsonDocument::fromJson(body, &parseError);

    if (error == QNetworkReply::NoError && parseError.error == QJsonParseError::NoError) {
        // Absent or not an array counts as no objects.
        const int count = int(document.object().value(QStringLiteral("ObjectMetaInfo")).toArray().size());
        const unsigned int end = request.value(kEndTimestamp).toUInt();
        QVariantMap data;
        data.insert(QStringLiteral("data"), body);
        data.insert(QStringLiteral("count"), count);
        emit receiveObjectMeta(cameraID, end, data);
    } else {
        // The windows behind the failed one go too; the synchroniser asks for them again.
        m_pendingRequests[cameraID].clear();
        emit requestFailed(cameraID);
        if (error == QNetworkReply::ContentAccessDenied) {
            DELVIX_LOG(LogFacility::LevelError,
                       "%s, Get camera %s object meta failed with access token, please check camera time and "
                       "server time is synchronized.",
                       "CameraProxy::handleHttpResponse", qPrintable(cameraID));
        } else {
            DELVIX_LOG(
                LogFacility::LevelError,
                "%s, Get camera %s object meta failed, network error: %d, parse error: %s, request: %s",
                "CameraProxy::handleHttpResponse", qPrintable(cameraID), int(error),
                qPrintable(parseError.errorString()), qPrintable(request.value(kPath).toString()));
        }
    }

    QQueue<QVariantMap>& queue = m_pendingRequests[cameraID];
    if (!queue.isEmpty()) {
        sendHttpRequest(queue.dequeue());
    } else {
        m_inFlight.remove(cameraID);
    }
}

QVariantMap CameraProxy::composePairTokenRequest(const QVariantMap& cameraRecord) const
{
    QVariantMap request;
    // Channel records carry their index as "MultiChannelID", so a channel asks for the camera's token.
    const QString channel =
        cameraRecord.contains(QStringLiteral("MultiChannel"))
            ? QStringLiteral("/c%1").arg(cameraRecord.value(QStringLiteral("MultiChannel")).toInt())
            : QString();
    request.insert(kPath,
                   QStringLiteral("/VCA") + channel +
                       QStringLiteral("/Secure/Token?method=GET&resource=/Data/DB/ObjMeta&client=NOVIR2"));
    request.insert(kCameraID, cameraRecord.value(QStringLiteral("Name")).toString());
    request.insert(kIp, cameraRecord.value(QStringLiteral("IP")).toString());
    request.insert(kPort, cameraRecord.value(QStringLiteral("Port")).toInt());
    request.insert(kUsername, cameraRecord.value(QStringLiteral("User")).toString());
    request.insert(kPassword, decodePassword(cameraRecord.value(QStringLiteral("Password"))));
    request.insert(kUseSSL, cameraRecord.value(QStringLiteral("UseSSL")).toBool());
    return request;
}

void CameraProxy::sendPairTokenRequest(const QVariantMap& cameraRecord)
{
    sendPairTokenHttpRequest(composePairTokenRequest(cameraRecord));
}

void CameraProxy::sendPairTokenHttpRequest(const QVariantMap& request)
{
    get(request, &CameraProxy::handlePairTokenHttpResponse);
}

void CameraProxy::handlePairTokenHttpResponse(const QVariantMap& request, QNetworkReply::NetworkError error,
                                              const QByteArray& body, bool)
{
    const QString cameraID = request.value(kCameraID).toString();
    if (error != QNetworkReply::NoError) {
        DELVIX_LOG(LogFacility::LevelError, "%s, Get camera %s token failed, network error: %d",
                   "CameraProxy::handlePairTokenHttpResponse", qPrintable(cameraID), int(error));
        return;
    }
    emit receivePairToken(cameraID, QString::fromUtf8(body));
}
