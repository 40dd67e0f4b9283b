// Fuzz target: the collector's writeData on any camera answer. The first byte sets the two
// thumbnail flags; the rest is the answer body as UTF-8 text. Whatever goes out must be one
// well-formed XML command whose Info text reads back as the filtered answer: a camera can
// neither break nor forge the message.
#include "CameraInformationCollector.h"
#include "IFrameworkTools.h"
#include "Quellon.h"
#include "ScriptedTunnelClient.h"

#include <QCoreApplication>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <cstdint>
#include <cstdlib>

namespace {

class FuzzTools final : public IFrameworkTools
{
public:
    explicit FuzzTools(INovirTunnelClient* client)
        : m_client(client)
    {}
    IPluginManager* GetPluginManager() override { return nullptr; }
    INovirTunnelClient* GetNovirTunnelClient() override { return m_client; }
    IRelaySender* GetRelaySender() override { return nullptr; }

private:
    INovirTunnelClient* m_client;
};

void check(bool condition)
{
    if (!condition) {
        std::abort();
    }
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

    ScriptedTunnelClient client;
    FuzzTools tools(&client);
    CameraInformationCollector collector(&tools);
    collector.setDelvixSettings(QVariantMap{{QStringLiteral("faceEnable"), bool(data[0] & 1)},
                                            {QStringLiteral("LPREnable"), bool(data[0] & 2)}});
    const QString body = QString::fromUtf8(reinterpret_cast<const char*>(data + 1), qsizetype(size - 1));
    collector.writeData(int(data[0]) - 128, 7, body);

    const int index = client.lastRequest(QStringLiteral("InputObjectMetaInfo"));
    const QJsonObject root = QJsonDocument::fromJson(body.toUtf8()).object();
    const bool hasObjects = !root.value(QStringLiteral("ObjectMetaInfo")).toArray().isEmpty();
    check((index >= 0) == hasObjects);
    if (index < 0) {
        return 0;
    }
    Quellon quellon;
    const QVariantMap message = quellon.parse(client.requests.at(index).info.strContent)
                                    .toMap()
                                    .value(QStringLiteral("InputObjectMetaInfo"))
                                    .toMap();
    check(message.size() == 5);
    check(message.value(QStringLiteral("GroupID")).toString() == QString::number(int(data[0]) - 128));
    const QByteArray info = message.value(QStringLiteral("Info")).toString().toUtf8();
    const QJsonDocument sent = QJsonDocument::fromJson(info);
    check(sent.isObject());
    // What was sent reads back as the answer after the documented changes, nothing more.
    QJsonObject expected = root;
    QJsonArray objects;
    for (const QJsonValue& element : root.value(QStringLiteral("ObjectMetaInfo")).toArray()) {
        QJsonObject object = element.toObject();
        if (!object.contains(QStringLiteral("ID"))) {
            object.insert(QStringLiteral("ID"), QJsonValue::Null);
        }
        if (!(data[0] & 1)) {
            object.remove(QStringLiteral("FaceThumbnail"));
        }
        if (!(data[0] & 2)) {
            object.remove(QStringLiteral("LicensePlateThumbnail"));
        }
        objects.append(object);
    }
    expected.insert(QStringLiteral("ObjectMetaInfo"), objects);
    check(sent.object() == expected);
    return 0;
}
