#include "NovirSite.h"

#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QSet>
#include <QXmlStreamReader>
#include <QXmlStreamWriter>
#include <cmath>

namespace {

QString element(const char* name, const QString& text)
{
    return QStringLiteral("<%1>%2</%1>").arg(QLatin1String(name), NovirSite::escape(text));
}

QString boolText(bool value)
{
    return value ? QStringLiteral("true") : QStringLiteral("false");
}

bool readCamera(const QJsonObject& object, int index, NovirCamera* camera, QString* error)
{
    auto fail = [&](const QString& what) {
        *error = QStringLiteral("camera %1: %2").arg(index).arg(what);
        return false;
    };
    static const QSet<QString> known = {
        QStringLiteral("name"),     QStringLiteral("ip"),        QStringLiteral("port"),
        QStringLiteral("useSSL"),   QStringLiteral("httpsPort"), QStringLiteral("user"),
        QStringLiteral("password"), QStringLiteral("record"),    QStringLiteral("protected"),
        QStringLiteral("channels"), QStringLiteral("channel"),   QStringLiteral("location"),
        QStringLiteral("groupId"),  QStringLiteral("live"),      QStringLiteral("online")};
    for (auto it = object.begin(); it != object.end(); ++it) {
        if (!known.contains(it.key())) {
            return fail(QStringLiteral("unknown key \"%1\"").arg(it.key()));
        }
    }
    auto text = [&](const char* key, QString* out) {
        const QJsonValue value = object.value(QLatin1String(key));
        if (value.isUndefined()) {
            return true;
        }
        if (!value.isString()) {
            return fail(QStringLiteral("\"%1\" must be a text").arg(QLatin1String(key)));
        }
        *out = value.toString();
        return true;
    };
    auto number = [&](const char* key, int low, int high, int* out) {
        const QJsonValue value = object.value(QLatin1String(key));
        if (value.isUndefined()) {
            return true;
        }
        const double d = value.toDouble();
        if (!value.isDouble() || d < low || d > high || d != std::floor(d)) {
            return fail(QStringLiteral("\"%1\" must be a whole number from %2 to %3")
                            .arg(QLatin1String(key))
                            .arg(low)
                            .arg(high));
        }
        *out = int(d);
        return true;
    };
    auto flag = [&](const char* key, bool* out) {
        const QJsonValue value = object.value(QLatin1String(key));
        if (value.isUndefined()) {
            return true;
        }
        if (!value.isBool()) {
            return fail(QStringLiteral("\"%1\" must be true or false").arg(QLatin1String(key)));
        }
        *out = value.toBool();
        return true;
    };
    if (!text("name", &camera->name) || !text("ip", &camera->ip) || !text("user", &camera->user) ||
        !text("password", &camera->password) || !text("location", &camera->location) ||
        !number("port", 1, 65535, &camera->port) || !number("httpsPort", 0, 65535, &camera->httpsPort) ||
        !number("channels", 1, 256, &camera->channelCount) || !number("channel", 0, 256, &camera->channel) ||
        !number("groupId", 0, 1 << 30, &camera->groupId) || !flag("useSSL", &camera->useSsl) ||
        !flag("record", &camera->recordCap) || !flag("protected", &camera->protectCap) ||
        !flag("live", &camera->live) || !flag("online", &camera->online)) {
        return false;
    }
    if (camera->name.isEmpty()) {
        return fail(QStringLiteral("\"name\" is required"));
    }
    return true;
}

} // namespace

bool NovirSite::fromJson(const QByteArray& json, NovirSite* site, QString* error)
{
    QJsonParseError parseError{};
    const QJsonDocument document = QJsonDocument::fromJson(json, &parseError);
    if (parseError.error != QJsonParseError::NoError || !document.isObject()) {
        *error = QStringLiteral("not a JSON object: %1").arg(parseError.errorString());
        return false;
    }
    const QJsonObject root = document.object();
    NovirSite result;
    if (root.contains(QLatin1String("serverId"))) {
        if (!root.value(QLatin1String("serverId")).isString() ||
            root.value(QLatin1String("serverId")).toString().isEmpty()) {
            *error = QStringLiteral("\"serverId\" must be a non-empty text");
            return false;
        }
        result.serverId = root.value(QLatin1String("serverId")).toString();
    }
    if (root.contains(QLatin1String("partSize"))) {
        const int partSize = root.value(QLatin1String("partSize")).toInt(0);
        if (partSize < 1) {
            *error = QStringLiteral("\"partSize\" must be a whole number of at least 1");
            return false;
        }
        result.partSize = partSize;
    }
    if (root.contains(QLatin1String("prettyXml"))) {
        if (!root.value(QLatin1String("prettyXml")).isBool()) {
            *error = QStringLiteral("\"prettyXml\" must be true or false");
            return false;
        }
        result.prettyXml = root.value(QLatin1String("prettyXml")).toBool();
    }
    if (root.contains(QLatin1String("vocabulary"))) {
        if (!root.value(QLatin1String("vocabulary")).isObject()) {
            *error = QStringLiteral("\"vocabulary\" must be an object of word lists");
            return false;
        }
        QString why;
        if (!result.vocabulary.merge(root.value(QLatin1String("vocabulary")).toObject(), &why)) {
            *error = QStringLiteral("vocabulary: %1").arg(why);
            return false;
        }
    }
    if (!root.value(QLatin1String("cameras")).isArray()) {
        *error = QStringLiteral("\"cameras\" must be a list");
        return false;
    }
    const QJsonArray cameras = root.value(QLatin1String("cameras")).toArray();
    QSet<QString> names;
    for (int i = 0; i < cameras.size(); ++i) {
        if (!cameras.at(i).isObject()) {
            *error = QStringLiteral("camera %1: not an object").arg(i);
            return false;
        }
        NovirCamera camera;
        if (!readCamera(cameras.at(i).toObject(), i, &camera, error)) {
            return false;
        }
        if (names.contains(camera.name)) {
            *error = QStringLiteral("camera %1: name \"%2\" used twice").arg(i).arg(camera.name);
            return false;
        }
        names.insert(camera.name);
        result.cameras.append(camera);
    }
    *site = result;
    return true;
}

bool NovirSite::fromFile(const QString& path, NovirSite* site, QString* error)
{
    QFile file(path);
    if (!file.open(QIODevice::ReadOnly)) {
        *error = QStringLiteral("cannot read %1: %2").arg(path, file.errorString());
        return false;
    }
    if (!fromJson(file.readAll(), site, error)) {
        *error = QStringLiteral("%1: %2").arg(path, *error);
        return false;
    }
    return true;
}

QByteArray NovirSite::defaultSiteJson()
{
    // Ports 18081-18086 are where the camera simulator serves these cameras.
    return QByteArrayLiteral(R"({
  "serverId": "cfg-server-1",
  "partSize": 3,
  "cameras": [
    {"name": "Entrance", "port": 18081, "user": "admin", "password": "entrance-pw",
     "location": "Loc1", "groupId": 1},
    {"name": "Lobby", "port": 18082, "user": "admin", "password": "lobby-pw",
     "location": "Loc2", "groupId": 1},
    {"name": "ParkingGate", "port": 18083, "user": "admin", "password": "gate-pw", "protected": true,
     "location": "Loc3", "groupId": 2},
    {"name": "Warehouse-1", "port": 18084, "user": "admin", "password": "store-pw",
     "channels": 2, "channel": 1, "location": "Loc4", "groupId": 2},
    {"name": "Warehouse-2", "port": 18084, "user": "admin", "password": "store-pw",
     "channels": 2, "channel": 2, "location": "Loc5", "groupId": 2},
    {"name": "Loading", "port": 18085, "user": "admin", "password": "loading-pw",
     "location": "Loc6", "groupId": 2, "online": false},
    {"name": "Corridor", "port": 18086, "user": "admin", "password": "corridor-pw"},
    {"name": "Storage", "port": 18087, "user": "admin", "password": "storage-pw", "record": false,
     "location": "Loc7", "groupId": 1}
  ]
})");
}

NovirSite NovirSite::defaultSite()
{
    NovirSite site;
    QString error;
    fromJson(defaultSiteJson(), &site, &error); // built in and tested; cannot fail
    return site;
}

QString NovirSite::escape(const QString& text)
{
    return text.toHtmlEscaped();
}

QString NovirSite::nodeInfoXml(const QList<NovirCamera>& cameras)
{
    QString xml = QStringLiteral("<NodeInfo><Cameras>");
    for (const NovirCamera& camera : cameras) {
        xml += QStringLiteral("<Cam>");
        xml += element("Name", camera.name);
        xml += element("IP", camera.ip);
        xml += element("Port", QString::number(camera.port));
        xml += element("UseSSL", boolText(camera.useSsl));
        if (camera.httpsPort > 0) {
            xml += element("HTTPSPort", QString::number(camera.httpsPort));
        }
        xml += element("User", camera.user);
        xml += element("Pwd", QString::fromLatin1(camera.password.toLatin1().toHex()));
        xml += element("ObjectMetaRecordCap", boolText(camera.recordCap));
        xml += element("ObjectMetaProtectCap", boolText(camera.protectCap));
        xml += element("NCh", QString::number(camera.channelCount));
        xml += element("Channel", QString::number(camera.channel));
        xml += QStringLiteral("</Cam>");
    }
    xml += QStringLiteral("</Cameras></NodeInfo>");
    return xml;
}

QString NovirSite::locationsXml(const QList<NovirCamera>& cameras)
{
    QString xml = QStringLiteral("<LocRecs>");
    for (bool live : {true, false}) {
        QString locs;
        for (const NovirCamera& camera : cameras) {
            if (camera.location.isEmpty() || camera.live != live) {
                continue;
            }
            locs += QStringLiteral("<Loc>") + element("Alias", camera.name) +
                    element("Name", camera.location) + element("GrpID", QString::number(camera.groupId)) +
                    QStringLiteral("</Loc>");
        }
        if (!locs.isEmpty()) {
            xml += QStringLiteral("<LocList>") + element("Live", boolText(live)) + locs +
                   QStringLiteral("</LocList>");
        }
    }
    xml += QStringLiteral("</LocRecs>");
    return xml;
}

QString NovirSite::cameraStatusXml(const QList<NovirCamera>& cameras)
{
    QString xml = QStringLiteral("<CamStatus>");
    for (const NovirCamera& camera : cameras) {
        xml += QStringLiteral("<Cam>") + element("Name", camera.name) +
               element("ConnState",
                       camera.online ? QStringLiteral("Connected") : QStringLiteral("Disconnected")) +
               QStringLiteral("</Cam>");
    }
    xml += QStringLiteral("</CamStatus>");
    return xml;
}

QString NovirSite::indentedXml(const QString& xml)
{
    QXmlStreamReader reader(xml);
    QString out;
    QXmlStreamWriter writer(&out);
    int depth = 0;
    const auto newLine = [&] {
        writer.writeCharacters(QLatin1Char('\n') + QString(2 * depth, QLatin1Char(' ')));
    };
    while (!reader.atEnd()) {
        switch (reader.readNext()) {
        case QXmlStreamReader::StartElement:
            depth > 0 ? newLine() : void();
            writer.writeStartElement(reader.name().toString());
            writer.writeAttributes(reader.attributes());
            ++depth;
            break;
        case QXmlStreamReader::EndElement:
            --depth;
            newLine();
            writer.writeEndElement();
            break;
        case QXmlStreamReader::Characters:
            if (!reader.isWhitespace()) {
                newLine();
                writer.writeCharacters(reader.text().toString());
            }
            break;
        default:
            break;
        }
    }
    return reader.hasError() ? xml : out;
}

QString NovirSite::exclusionReasons(const NovirCamera& camera)
{
    QStringList reasons;
    if (!camera.recordCap) {
        reasons << QStringLiteral("records no object metadata");
    }
    if (camera.location.isEmpty()) {
        reasons << QStringLiteral("has no recording location");
    }
    if (!camera.online) {
        reasons << QStringLiteral("offline");
    }
    return reasons.join(QStringLiteral(", "));
}
