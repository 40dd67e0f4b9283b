// Fuzz target: the XML converter and the tunnel control's parsers and handlers. The first byte
// picks the path the rest of the input takes (as UTF-8 text):
//   0 converter alone, 1 all-cameras answer part, 2 location answer part, 3 single-camera
//   answer, 4..8 the broadcasts, 9 a camera status event.
// Every camera or location the parsers produce must carry the record keys and types the
// directory relies on; anything else is a crash.
#include "NOVIRImplementation/NOVIRSrvTunnelControl.h"
#include "Quellon.h"
#include "ScriptedTunnelClient.h"

#include <QCoreApplication>
#include <cstdint>
#include <cstdlib>

namespace {

void check(bool condition)
{
    if (!condition) {
        std::abort();
    }
}

void checkCameraRecord(const QVariantMap& record)
{
    check(record.value(QStringLiteral("Name")).typeId() == QMetaType::QString);
    check(record.value(QStringLiteral("Port")).typeId() == QMetaType::Int);
    check(record.value(QStringLiteral("UseSSL")).typeId() == QMetaType::Bool);
    check(record.value(QStringLiteral("DelvixProtect")).typeId() == QMetaType::Bool);
    for (const char* key : {"IP", "User", "Password"}) {
        const QVariant value = record.value(QLatin1String(key));
        check(!value.isValid() || value.typeId() == QMetaType::QString);
    }
    const QVariant channel = record.value(QStringLiteral("MultiChannelID"));
    check(!channel.isValid() || channel.toInt() >= 0);
    check(record.size() == 7 || (record.size() == 8 && channel.isValid()));
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    if (size < 1) {
        return 0;
    }
    static int argc = 1;
    static char name[] = "fuzz";
    static char* argv[] = {name, nullptr};
    static QCoreApplication* app = QCoreApplication::instance() ? nullptr : new QCoreApplication(argc, argv);
    (void)app;

    const int mode = data[0] % 10;
    const QString text = QString::fromUtf8(reinterpret_cast<const char*>(data + 1), qsizetype(size - 1));
    if (mode == 0) {
        Quellon quellon;
        const QVariant tree = quellon.parse(text);
        if (tree.isValid()) {
            check(tree.typeId() == QMetaType::QVariantMap && tree.toMap().size() == 1);
            for (const QVariant& value : tree.toMap()) {
                Quellon::transContentAsList(value);
            }
        }
        return 0;
    }

    ScriptedTunnelClient client;
    NOVIRSrvTunnelControl control(&client);
    QObject::connect(&control, &NOVIRSrvTunnelControl::updateCameras, [](const QVariantMap& cameras) {
        for (const QVariant& record : cameras) {
            checkCameraRecord(record.toMap());
        }
    });
    QObject::connect(&control, &NOVIRSrvTunnelControl::updateCamera,
                     [](const QString&, const QVariantMap& record) { checkCameraRecord(record); });
    QObject::connect(&control, &NOVIRSrvTunnelControl::updateLocations, [](const QVariantMap& locations) {
        for (const QVariant& record : locations) {
            check(record.toMap().size() == 3);
        }
    });
    client.connectServer(NSNovirTunnelClient::ConfigServer);
    client.connectServer(NSNovirTunnelClient::LocationServer);
    switch (mode) {
    case 1:
        client.answer(client.lastRequest(QStringLiteral("GetNodeInfo")), true, QStringLiteral("0"), text,
                      false);
        client.answer(client.lastRequest(QStringLiteral("GetNodeInfo")), true, QStringLiteral("0"), text,
                      true);
        break;
    case 2:
        client.answer(client.lastRequest(QStringLiteral("QryLocs")), true, QStringLiteral("0"), text, true);
        break;
    case 3:
        client.broadcast(QStringLiteral("CamIns"), QString(),
                         QStringLiteral("<CamIns><Entry><Name>x</Name></Entry></CamIns>"));
        client.answer(client.lastRequest(QStringLiteral("GetNodeInfo")), true, QStringLiteral("0"), text,
                      true);
        break;
    case 4:
    case 5:
    case 6:
    case 7:
    case 8: {
        static const char* names[] = {"CamIns", "CamRmv", "CamInfoChange", "ChannelAdd", "ChannelRmv"};
        client.broadcast(QLatin1String(names[mode - 4]), QString(), text);
        break;
    }
    default:
        client.statusEvent(client.serverId, QString(), text);
        break;
    }
    return 0;
}
