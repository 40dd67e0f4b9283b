// Camera directory: forwarding a camera's metadata answer (writeData) and turning a
// node-information answer into the camera-information map.
#include "CameraInformationCollector.h"
#include "IFrameworkTools.h"
#include "NOVIRImplementation/NOVIRSrvTunnelControl.h"
#include "NovirSite.h"

#include <QCoreApplication>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <benchmark/benchmark.h>

namespace {

// Accepts every request, keeps the last content's size and the all-cameras callback.
class SinkClient final : public INovirTunnelClient
{
public:
    qsizetype lastContentSize = 0;
    NSNovirTunnelClient::ResponseCallback allCameras;
    char account = 0;
    char server = 0;

    void* getServerAccountID() override { return &account; }
    QVariant getServerInfo(Qt::HANDLE, int) override { return QStringLiteral("srv"); }
    bool isServerConnected(NSNovirTunnelClient::ServerType) override { return true; }
    bool insertRequest(const QString&, void*, NSNovirTunnelClient::ServerType, const QString& cmdName,
                       const NSNovirTunnelClient::RequestInfo& request) override
    {
        lastContentSize = request.strContent.size();
        if (cmdName == QLatin1String("GetNodeInfo") && !allCameras) {
            allCameras = request.respCB;
        }
        return true;
    }
    bool insertSubscribeRequest(const QString&, void*, NSNovirTunnelClient::ServerType, const QString&,
                                const NSNovirTunnelClient::RequestInfo&, const QString&,
                                const NSNovirTunnelClient::EventHandler&) override
    {
        return true;
    }
    void registerConnectStatusHandler(const QString&, NSNovirTunnelClient::ServerType,
                                      const NSNovirTunnelClient::ConnectStatusHandler& handler,
                                      const QString&) override
    {
        connect = handler;
    }
    void registerEventHandler(const QString&, void*, NSNovirTunnelClient::ServerType, const QString&,
                              const NSNovirTunnelClient::EventHandler&, const QString&) override
    {}
    void registerBroadcastHandler(const QString&, void*, NSNovirTunnelClient::ServerType, const QString&,
                                  const NSNovirTunnelClient::BroadcastHandler&, const QString&) override
    {}
    NSNovirTunnelClient::ConnectStatusHandler connect;
};

class SinkTools final : public IFrameworkTools
{
public:
    explicit SinkTools(INovirTunnelClient* client)
        : m_client(client)
    {}
    IPluginManager* GetPluginManager() override { return nullptr; }
    INovirTunnelClient* GetNovirTunnelClient() override { return m_client; }
    IRelaySender* GetRelaySender() override { return nullptr; }

private:
    INovirTunnelClient* m_client;
};

// A camera answer of about `bytes` bytes: people and vehicles with trajectories, thumbnails and
// face or plate crops, as the cameras send them.
QString cameraAnswer(qsizetype bytes, int* objectCount)
{
    QJsonArray objects;
    qsizetype size = 0;
    const QString image = QString(160, QLatin1Char('A'));
    for (int i = 0; size < bytes; ++i) {
        QJsonObject object;
        object.insert(QStringLiteral("ID"), 1000000 + i);
        const bool human = i % 3 != 0;
        object.insert(QStringLiteral("ObjectType"),
                      human ? QStringLiteral("Human") : QStringLiteral("Vehicle"));
        object.insert(QStringLiteral("StartTime"), 1700000000 + i);
        object.insert(QStringLiteral("EndTime"), 1700000005 + i);
        object.insert(QStringLiteral("Attributes"),
                      human ? QJsonObject{{QStringLiteral("Age"), QStringLiteral("30")},
                                          {QStringLiteral("Gender"), 1},
                                          {QStringLiteral("UpperColor"), QJsonArray{1, 4}}}
                            : QJsonObject{{QStringLiteral("Type"), QStringLiteral("Car")},
                                          {QStringLiteral("PlateNumber"), QStringLiteral("AB%1").arg(i)}});
        object.insert(QStringLiteral("Trajectory"),
                      QJsonArray{QJsonObject{{QStringLiteral("x"), 0.1}, {QStringLiteral("y"), 0.2}},
                                 QJsonObject{{QStringLiteral("x"), 0.3}, {QStringLiteral("y"), 0.4}}});
        object.insert(QStringLiteral("Thumbnail"), QJsonArray{QJsonObject{{QStringLiteral("image"), image}}});
        object.insert(human ? QStringLiteral("FaceThumbnail") : QStringLiteral("LicensePlateThumbnail"),
                      QJsonArray{QJsonObject{{QStringLiteral("image"), image.left(40)}}});
        size += QJsonDocument(object).toJson(QJsonDocument::Compact).size() + 1;
        objects.append(object);
    }
    *objectCount = int(objects.size());
    return QString::fromUtf8(QJsonDocument(QJsonObject{{QStringLiteral("ObjectMetaInfo"), objects}})
                                 .toJson(QJsonDocument::Compact));
}

void BM_WriteData(benchmark::State& state)
{
    int objects = 0;
    const QString body = cameraAnswer(state.range(0) * 1024 * 1024, &objects);
    SinkClient client;
    SinkTools tools(&client);
    CameraInformationCollector collector(&tools);
    // Face crops filtered: the key removal is part of the measured work.
    collector.setDelvixSettings(
        QVariantMap{{QStringLiteral("faceEnable"), false}, {QStringLiteral("LPREnable"), true}});
    for (auto _ : state) {
        collector.writeData(1, 4, body);
        benchmark::DoNotOptimize(client.lastContentSize);
    }
    state.counters["objects"] = objects;
    state.counters["body_bytes"] = double(body.toUtf8().size());
    state.SetBytesProcessed(state.iterations() * body.toUtf8().size());
}
BENCHMARK(BM_WriteData)->Arg(1)->Arg(5)->Unit(benchmark::kMillisecond)->MinTime(2.0);

// The floor writeData stands on: parse, drop the face crops, serialise compactly.
void BM_JsonFloor(benchmark::State& state)
{
    int objects = 0;
    const QByteArray body = cameraAnswer(state.range(0) * 1024 * 1024, &objects).toUtf8();
    for (auto _ : state) {
        QJsonObject root = QJsonDocument::fromJson(body).object();
        QJsonArray list = root.value(QStringLiteral("ObjectMetaInfo")).toArray();
        for (qsizetype i = 0; i < list.size(); ++i) {
            QJsonObject object = list.at(i).toObject();
            object.remove(QStringLiteral("FaceThumbnail"));
            list.replace(i, object);
        }
        root.insert(QStringLiteral("ObjectMetaInfo"), list);
        benchmark::DoNotOptimize(QJsonDocument(root).toJson(QJsonDocument::Compact));
    }
}
BENCHMARK(BM_JsonFloor)->Arg(1)->Arg(5)->Unit(benchmark::kMillisecond)->MinTime(2.0);

void BM_ParseNodeInfo1000(benchmark::State& state)
{
    QList<NovirCamera> cameras;
    for (int i = 0; i < 1000; ++i) {
        NovirCamera camera;
        camera.name = QStringLiteral("Camera-%1").arg(i, 4, 10, QLatin1Char('0'));
        camera.port = 18000 + i % 1000;
        camera.user = QStringLiteral("admin");
        camera.password = QStringLiteral("pw%1").arg(i);
        camera.protectCap = i % 7 == 0;
        camera.useSsl = i % 5 == 0;
        camera.httpsPort = camera.useSsl ? 8443 : 0;
        camera.channelCount = i % 10 == 0 ? 4 : 1;
        cameras.append(camera);
    }
    const QString answer = NovirSite::nodeInfoXml(cameras);
    SinkClient client;
    NOVIRSrvTunnelControl control(&client);
    qsizetype announced = 0;
    QObject::connect(&control, &NOVIRSrvTunnelControl::updateCameras,
                     [&announced](const QVariantMap& map) { announced = map.size(); });
    client.connect(&client.server, NSNovirTunnelClient::ConfigServer, true);
    for (auto _ : state) {
        // Each pass is a fresh request, so the announcement holds exactly this answer.
        client.allCameras = nullptr;
        client.connect(&client.server, NSNovirTunnelClient::ConfigServer, true);
        client.allCameras(true, QStringLiteral("GetNodeInfo"), QString(), QStringLiteral("0"), answer, true);
    }
    if (announced != 1000) {
        state.SkipWithError("the answer did not yield 1000 cameras");
    }
    state.counters["answer_bytes"] = double(answer.toUtf8().size());
}
BENCHMARK(BM_ParseNodeInfo1000)->Unit(benchmark::kMillisecond)->MinTime(2.0);

} // namespace

int main(int argc, char** argv)
{
    QCoreApplication app(argc, argv);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
