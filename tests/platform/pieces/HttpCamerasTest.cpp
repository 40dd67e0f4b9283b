// The HTTP client against simulated cameras on loopback: every way a call can end, each completed
// once on the owner thread; and what the cameras answer: the objects of a window, access tokens,
// channels and their directory records.
#include "BraskHttpClient.h"
#include "CameraSimulator.h"
#include "TestWait.h"
#include "Zelto.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QTcpServer>
#include <QThread>
#include <QUrl>
#include <QtEndian>
#include <gtest/gtest.h>

#include <cmath>
#include <thread>

using namespace Qt::StringLiterals;
using Error = QNetworkReply::NetworkError;

namespace {

struct Outcome
{
    bool accepted = false; // what Get returned
    int calls = 0;
    Error error = QNetworkReply::UnknownNetworkError;
    QByteArray headers, body;
    bool abandoned = false;
    QThread* thread = nullptr;
};

QString window(qint64 start, qint64 end, const QString& prefix = u"/VCA"_s)
{
    return u"%1/Data/DB/ObjectMeta?StartTime=%2&EndTime=%3&Info=127"_s.arg(prefix).arg(start).arg(end);
}

QString tokenPath(const QString& token)
{
    return u"/VCA/Data/DB/ObjMeta?accessToken=%1&StartTime=1000&EndTime=1060&Info=127"_s.arg(token);
}

QJsonArray objects(const QByteArray& body)
{
    return QJsonDocument::fromJson(body).object().value(u"ObjectMetaInfo"_s).toArray();
}

double cosine(const QJsonArray& a, const QVector<float>& b)
{
    double dot = 0, na = 0, nb = 0;
    for (int i = 0; i < a.size(); ++i) {
        dot += a[i].toDouble() * b[i];
        na += a[i].toDouble() * a[i].toDouble();
        nb += double(b[i]) * b[i];
    }
    return dot / std::sqrt(na * nb);
}

class HttpCamerasTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        QList<CameraSetup> setups;
        for (const char* name : {"door", "hall", "vault", "yard", "digest", "tls"}) {
            CameraSetup setup;
            setup.name = QLatin1String(name);
            setup.objectsPerMinute = 50;
            setups << setup;
        }
        setups[2].protectedMetadata = true;
        setups[3].channels = 2;
        setups[4].digestAuth = true;
        setups[5].useSSL = true;
        QString error;
        ASSERT_TRUE(m_cameras.start(setups, &error)) << qPrintable(error);
    }

    // Starts a GET to a camera ("closed": a port nobody listens on; an unknown name: port 0).
    std::shared_ptr<Outcome> get(BraskHttpClient& client, const QString& camera, const QString& path,
                                 const QString& password = u"admin"_s, unsigned int timeoutMs = 10000)
    {
        quint16 port = m_cameras.port(camera);
        if (camera == u"closed"_s) {
            QTcpServer probe;
            probe.listen(QHostAddress::LocalHost, 0);
            port = probe.serverPort();
        }
        auto outcome = std::make_shared<Outcome>();
        outcome->accepted = client.Get(
            u"127.0.0.1"_s, path, port, camera == u"tls"_s, u"admin"_s, password,
            [outcome](Error error, const QByteArray& headers, const QByteArray& body, bool abandoned) {
                *outcome = {outcome->accepted, outcome->calls + 1,      error, headers, body,
                            abandoned,         QThread::currentThread()};
            },
            timeoutMs, {});
        EXPECT_EQ(outcome->calls, 0) << "completed inside Get";
        return outcome;
    }

    std::shared_ptr<Outcome> fetch(BraskHttpClient& client, const QString& camera, const QString& path)
    {
        auto outcome = get(client, camera, path);
        EXPECT_TRUE(waitFor([&] { return outcome->calls > 0; })) << qPrintable(path);
        return outcome;
    }

    CameraSimulator m_cameras;
};

} // namespace

TEST_F(HttpCamerasTest, EveryCallEndsOnceOnTheOwnerThreadWithQtsCode)
{
    enum Change
    {
        None,
        Failing,
        Malformed,
        Slow,
        Verifying,
        SmallLimit
    };
    struct Row
    {
        const char* camera;
        QString path;
        const char* password;
        Change change;
        Error error;
        bool abandoned;
    };
    const QString w = window(1000, 1060);
    const Row rows[] = {
        {"door", w, "admin", None, QNetworkReply::NoError, false},
        {"door", w, "wrong", None, QNetworkReply::AuthenticationRequiredError, false},
        {"digest", w, "admin", None, QNetworkReply::NoError, false},
        {"digest", w, "wrong", None, QNetworkReply::AuthenticationRequiredError, false},
        {"tls", w, "admin", None, QNetworkReply::NoError, false}, // self-signed, on loopback
        {"tls", w, "admin", Verifying, QNetworkReply::SslHandshakeFailedError, false},
        {"door", u"/VCA/nothing/here"_s, "admin", None, QNetworkReply::ContentNotFoundError, false},
        {"vault", w, "admin", None, QNetworkReply::ContentAccessDenied, false}, // no access token
        {"vault", tokenPath(u"made-up"_s), "admin", None, QNetworkReply::ContentAccessDenied, false},
        {"yard", window(1000, 1060, u"/VCA/c1"_s), "admin", None, QNetworkReply::NoError, false},
        {"yard", window(1000, 1060, u"/VCA/c2"_s), "admin", None, QNetworkReply::ContentNotFoundError, false},
        {"door", window(1000, 1060, u"/VCA/c0"_s), "admin", None, QNetworkReply::ContentNotFoundError, false},
        {"door", window(1060, 1000), "admin", None, QNetworkReply::ProtocolInvalidOperationError, false},
        {"door", u"/VCA/Data/DB/ObjectMeta?StartTime=x&EndTime=1"_s, "admin", None,
         QNetworkReply::ProtocolInvalidOperationError, false},
        {"door", w, "admin", Failing, QNetworkReply::InternalServerError, false},
        {"door", w, "admin", Malformed, QNetworkReply::NoError, false},
        {"door", w, "admin", SmallLimit, QNetworkReply::UnknownContentError, true},
        {"door", w, "admin", Slow, QNetworkReply::TimeoutError, true},
        {"closed", w, "admin", None, QNetworkReply::ConnectionRefusedError, false},
        {"none", w, "admin", None, QNetworkReply::ProtocolInvalidOperationError, false}, // port 0
    };
    std::vector<std::unique_ptr<BraskHttpClient>> clients; // kept, so a second completion would show
    std::vector<std::shared_ptr<Outcome>> outcomes;
    for (const Row& row : rows) {
        SCOPED_TRACE(std::string(row.camera) + " " + row.path.toStdString() + " change " +
                     std::to_string(row.change));
        BraskHttpClient::Options options;
        options.acceptSelfSignedOnLocalNetwork = row.change != Verifying;
        options.maxBodyBytes = row.change == SmallLimit ? 1000 : options.maxBodyBytes;
        clients.push_back(std::make_unique<BraskHttpClient>(options));
        m_cameras.setFailing("door", row.change == Failing);
        m_cameras.setMalformed("door", row.change == Malformed);
        m_cameras.setSlow("door", row.change == Slow ? scaledMs(3000) : 0);
        m_cameras.clearServedRequests();

        auto outcome = get(*clients.back(), row.camera, row.path, QLatin1String(row.password),
                           row.change == Slow ? scaledMs(200) : 10000);
        outcomes.push_back(outcome);
        ASSERT_TRUE(waitFor([&] { return outcome->calls > 0; }));
        EXPECT_EQ(outcome->error, row.error);
        EXPECT_EQ(outcome->abandoned, row.abandoned);
        EXPECT_EQ(outcome->accepted, row.camera != std::string("none"));
        if (row.abandoned) {
            EXPECT_TRUE(outcome->body.isEmpty());
        } else if (row.error == QNetworkReply::NoError) {
            EXPECT_TRUE(outcome->headers.contains("Content-Type: application/json"));
            EXPECT_EQ(objects(outcome->body).isEmpty(), row.change == Malformed)
                << outcome->body.left(80).data();
        }
        if (row.error == QNetworkReply::AuthenticationRequiredError) {
            // One challenge is answered, the second one ends the exchange.
            EXPECT_EQ(m_cameras.servedRequests().size(), 2);
        }
    }
    for (size_t i = 0; i < outcomes.size(); ++i) {
        EXPECT_EQ(outcomes[i]->calls, 1) << i;
        EXPECT_EQ(outcomes[i]->thread, QThread::currentThread()) << i;
        EXPECT_EQ(clients[i]->outstandingCount(), 0) << i;
    }
}

TEST_F(HttpCamerasTest, DestroyingTheClientCancelsRunningAndQueuedCalls)
{
    m_cameras.setSlow("door", scaledMs(5000));
    auto client = std::make_unique<BraskHttpClient>();
    auto running = get(*client, "door", window(1000, 1060));
    ASSERT_TRUE(waitFor([&] { return m_cameras.servedRequests().size() == 1; }));
    auto queued = get(*client, "door", window(1000, 1060)); // not started before the client goes
    client.reset();
    for (const auto& outcome : {running, queued}) {
        EXPECT_EQ(outcome->calls, 1);
        EXPECT_EQ(outcome->error, QNetworkReply::OperationCanceledError);
        EXPECT_TRUE(outcome->abandoned);
    }
}

TEST_F(HttpCamerasTest, CallFromAnotherThreadCompletesOnTheOwnerThread)
{
    BraskHttpClient client;
    std::shared_ptr<Outcome> outcome;
    std::thread([&] { outcome = get(client, "door", window(1000, 1060)); }).join();
    ASSERT_TRUE(waitFor([&] { return outcome->calls > 0; }));
    EXPECT_EQ(outcome->error, QNetworkReply::NoError);
    EXPECT_EQ(outcome->thread, QThread::currentThread());
}

TEST(BraskHttpClient, SelfSignedCertificatesAreAcceptedOnlyFromLocalNetworkHosts)
{
    for (const char* host : {"127.0.0.1", "192.168.3.7", "172.20.0.1", "10.1.2.3", "fe80::1", "LOCALHOST"}) {
        EXPECT_TRUE(BraskHttpClient::isLocalNetworkHost(host)) << host;
    }
    for (const char* host :
         {"172.32.0.1", "8.8.8.8", "192.169.0.1", "camera.example.com", "localhost.evil"}) {
        EXPECT_FALSE(BraskHttpClient::isLocalNetworkHost(host)) << host;
    }
}

TEST_F(HttpCamerasTest, AnswersHoldTheWindowsObjectsTheSameEachTimeWithTheIdentitysFeature)
{
    BraskHttpClient client;
    const ObjectGenerator& generator = m_cameras.generator();
    const qint64 from = 1'700'000'000, to = from + 180;
    for (const QString& camera : {u"door"_s, u"hall"_s}) {
        const QByteArray body = fetch(client, camera, window(from, to))->body;
        EXPECT_EQ(fetch(client, camera, window(from, to))->body, body);
        const QJsonArray list = objects(body);
        EXPECT_EQ(list.size(), generator.objectCount(camera, from, to, 50));
        EXPECT_NEAR(list.size(), 150, 3);
        qint64 previousId = -1;
        int inMiddleMinute = 0;
        for (int i = 0; i < list.size(); ++i) {
            const QJsonObject object = list[i].toObject();
            EXPECT_GT(object["ID"].toInteger(), previousId);
            previousId = object["ID"].toInteger();
            const qint64 start = object["StartTime"].toInteger();
            EXPECT_TRUE(start >= from && start < to) << start;
            EXPECT_GT(object["EndTime"].toInteger(), start);
            inMiddleMinute += start >= from + 60 && start < from + 120 ? 1 : 0;

            // The same identity looks alike on every camera, and unlike any other.
            const QJsonObject thumbnail = object["Thumbnail"][0].toObject();
            const QJsonArray feature = thumbnail["feature"].toArray();
            const int identity = generator.identityOf(camera, from, to, 50, i);
            ASSERT_EQ(feature.size(), ObjectGenerator::kFeatureLength);
            EXPECT_GT(cosine(feature, generator.baseFeature(identity)), 0.8);
            EXPECT_LT(cosine(feature, generator.baseFeature((identity + 1) % generator.populationSize())),
                      0.3);

            // A real 8x16 RGB PNG: its pixel data inflates to 16 rows of a filter byte and 8 pixels.
            const QByteArray png = QByteArray::fromBase64(thumbnail["image"].toString().toLatin1());
            ASSERT_TRUE(png.startsWith("\x89PNG\r\n\x1a\n"));
            QByteArray zlib(4, '\0');
            qToBigEndian<quint32>(16 * (1 + 3 * 8), zlib.data());
            const int idatLength = int(qFromBigEndian<quint32>(png.constData() + 33));
            EXPECT_EQ(qUncompress(zlib + png.mid(41, idatLength)).size(), 16 * (1 + 3 * 8));
        }
        EXPECT_EQ(objects(fetch(client, camera, window(from + 60, from + 120))->body).size(), inMiddleMinute);
    }
}

TEST_F(HttpCamerasTest, ProtectedCameraAnswersAnAccessTokenMadeFromItsPairToken)
{
    BraskHttpClient client;
    const auto pair = fetch(client, "vault", u"/VCA/Secure/Token?method=GET&resource=/Data/DB/ObjMeta"_s);
    ASSERT_EQ(pair->error, QNetworkReply::NoError);
    EXPECT_EQ(m_cameras.issuedPairTokens("vault"), QStringList{QString::fromUtf8(pair->body)});
    auto manager = Zelto::CreateProtectedAPIManager("", 0, true);
    manager->SetPairToken(pair->body.constData(), size_t(pair->body.size()), true);
    const QByteArray token = QUrl::toPercentEncoding(QString::fromStdString(manager->GetAccessToken()));
    for (const char* camera : {"vault", "door"}) { // unprotected cameras take the token path as well
        const auto granted = fetch(client, camera, tokenPath(QString::fromLatin1(token)));
        EXPECT_EQ(granted->error, QNetworkReply::NoError) << camera;
        EXPECT_FALSE(objects(granted->body).isEmpty()) << camera;
        EXPECT_TRUE(m_cameras.servedRequests().last().withAccessToken);
    }
}

TEST_F(HttpCamerasTest, ChannelsAreCamerasOfTheirOwnInTheDirectory)
{
    BraskHttpClient client;
    EXPECT_NE(fetch(client, "yard", window(1000, 1060, u"/VCA/c0"_s))->body,
              fetch(client, "yard", window(1000, 1060, u"/VCA/c1"_s))->body);
    const QVariantMap directory = m_cameras.directoryMap();
    EXPECT_EQ(directory.keys(),
              (QStringList{"digest", "door", "hall", "tls", "vault", "yard-c0", "yard-c1"}));
    const QVariantMap channel = directory["yard-c1"].toMap();
    EXPECT_EQ(channel["MultiChannelID"].toString(), "1");
    EXPECT_EQ(channel["Port"].toInt(), m_cameras.port("yard"));
    EXPECT_NE(channel["Location"], directory["yard-c0"].toMap()["Location"]);
    EXPECT_EQ(QByteArray::fromHex(channel["Password"].toString().toLatin1()), "admin");
    EXPECT_TRUE(directory["vault"].toMap()["DelvixProtect"].toBool());
    EXPECT_TRUE(directory["tls"].toMap()["UseSSL"].toBool());
    EXPECT_FALSE(directory["door"].toMap().contains("MultiChannelID"));
}

TEST(CameraSimulator, FixedPortIsUsedAndATakenOneIsReported)
{
    CameraSetup setup;
    setup.name = u"fixed"_s;
    {
        QTcpServer probe;
        ASSERT_TRUE(probe.listen(QHostAddress::LocalHost, 0));
        setup.port = probe.serverPort();
    }
    CameraSimulator first, second;
    ASSERT_TRUE(first.start({setup}));
    EXPECT_EQ(first.port("fixed"), setup.port);
    QString error;
    EXPECT_FALSE(second.start({setup}, &error));
    EXPECT_TRUE(error.contains(QString::number(setup.port))) << qPrintable(error);
    EXPECT_EQ(second.port("fixed"), 0);
}
