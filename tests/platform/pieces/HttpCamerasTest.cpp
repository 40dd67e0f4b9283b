// The HTTP client against simulated cameras on loopback: every way a call can end, each completed
// once on the owner thread, and the objects a camera answers for a window. Fetching through access
// tokens, TLS and channels end to end is the camera synchronisation's integration test.
#include "BraskHttpClient.h"
#include "CameraSimulator.h"
#include "TestWait.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QTcpServer>
#include <QThread>
#include <QtEndian>
#include <gtest/gtest.h>

#include <thread>

using namespace Qt::StringLiterals;
using Error = QNetworkReply::NetworkError;

namespace {

struct Outcome
{
    bool accepted = false, abandoned = false; // accepted: what Get returned
    int calls = 0;
    Error error = QNetworkReply::UnknownNetworkError;
    QByteArray headers, body;
    QThread* thread = nullptr;
};

QString window(qint64 start, qint64 end, const QString& prefix = u"/VCA"_s)
{
    return u"%1/Data/DB/ObjectMeta?StartTime=%2&EndTime=%3&Info=127"_s.arg(prefix).arg(start).arg(end);
}

QJsonArray objects(const QByteArray& body)
{
    return QJsonDocument::fromJson(body).object().value(u"ObjectMetaInfo"_s).toArray();
}

class HttpCamerasTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        QList<CameraSetup> setups;
        for (const char* name : {"door", "hall", "vault", "yard", "digest", "tls"}) {
            setups.append(CameraSetup()), setups.last().name = QLatin1String(name),
                                          setups.last().objectsPerMinute = 50;
        }
        setups[2].protectedMetadata = setups[4].digestAuth = setups[5].useSSL = true;
        setups[3].channels = 2;
        ASSERT_TRUE(m_cameras.start(setups));
    }

    // Starts a GET to a camera ("closed": a port nobody listens on; an unknown name: port 0).
    std::shared_ptr<Outcome> get(BraskHttpClient& client, const QString& camera, const QString& path,
                                 const QString& password = u"admin"_s, unsigned int timeoutMs = 10000)
    {
        QTcpServer probe;
        probe.listen(QHostAddress::LocalHost, 0);
        const quint16 port = camera == u"closed"_s ? probe.serverPort() : m_cameras.port(camera);
        probe.close();
        auto out = std::make_shared<Outcome>();
        out->accepted =
            client.Get(u"127.0.0.1"_s, path, port, camera == u"tls"_s, u"admin"_s, password,
                       [out](Error error, const QByteArray& headers, const QByteArray& body, bool abandoned) {
                           *out = {out->accepted, abandoned, out->calls + 1,          error,
                                   headers,       body,      QThread::currentThread()};
                       },
                       timeoutMs, {});
        EXPECT_EQ(out->calls, 0) << "completed inside Get";
        return out;
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
    const QString w = window(1000, 1060);
    const struct
    {
        const char* camera;
        QString path;
        std::string change; // of the client or the camera for this call
        Error error;
    } rows[] = {
        {"door", w, "", QNetworkReply::NoError},
        {"door", w, "wrong password", QNetworkReply::AuthenticationRequiredError},
        {"digest", w, "", QNetworkReply::NoError},
        {"digest", w, "wrong password", QNetworkReply::AuthenticationRequiredError},
        {"tls", w, "", QNetworkReply::NoError}, // self-signed, on loopback
        {"tls", w, "verifying", QNetworkReply::SslHandshakeFailedError},
        {"door", u"/VCA/nothing/here"_s, "", QNetworkReply::ContentNotFoundError},
        {"vault", w, "", QNetworkReply::ContentAccessDenied}, // no access token
        {"vault", u"/VCA/Data/DB/ObjMeta?accessToken=made-up&StartTime=1&EndTime=2"_s, "",
         QNetworkReply::ContentAccessDenied},
        {"yard", window(1000, 1060, u"/VCA/c1"_s), "", QNetworkReply::NoError},
        {"yard", window(1000, 1060, u"/VCA/c2"_s), "", QNetworkReply::ContentNotFoundError},
        {"door", window(1000, 1060, u"/VCA/c0"_s), "", QNetworkReply::ContentNotFoundError},
        {"door", window(1060, 1000), "", QNetworkReply::ProtocolInvalidOperationError},
        {"door", u"/VCA/Data/DB/ObjectMeta?StartTime=x&EndTime=1"_s, "",
         QNetworkReply::ProtocolInvalidOperationError},
        {"door", w, "failing", QNetworkReply::InternalServerError},
        {"door", w, "malformed", QNetworkReply::NoError},
        {"door", w, "small limit", QNetworkReply::UnknownContentError},
        {"door", w, "slow", QNetworkReply::TimeoutError},
        {"closed", w, "", QNetworkReply::ConnectionRefusedError},
        {"none", w, "", QNetworkReply::ProtocolInvalidOperationError}, // port 0
    };
    std::vector<std::unique_ptr<BraskHttpClient>> clients; // kept, so a second completion would show
    std::vector<std::shared_ptr<Outcome>> outcomes;
    for (const auto& row : rows) {
        SCOPED_TRACE(std::string(row.camera) + " " + row.path.toStdString() + " " + row.change);
        BraskHttpClient::Options options;
        options.acceptSelfSignedOnLocalNetwork = row.change != "verifying";
        options.maxBodyBytes = row.change == "small limit" ? 1000 : options.maxBodyBytes;
        clients.push_back(std::make_unique<BraskHttpClient>(options));
        m_cameras.setFailing("door", row.change == "failing");
        m_cameras.setMalformed("door", row.change == "malformed");
        m_cameras.setSlow("door", row.change == "slow" ? scaledMs(3000) : 0);
        m_cameras.clearServedRequests();
        auto out =
            get(*clients.back(), row.camera, row.path, row.change == "wrong password" ? u"x"_s : u"admin"_s,
                row.change == "slow" ? scaledMs(200) : 10000);
        outcomes.push_back(out);
        ASSERT_TRUE(waitFor([&] { return out->calls > 0; }));
        EXPECT_EQ(out->error, row.error);
        EXPECT_EQ(out->abandoned, row.change == "slow" || row.change == "small limit");
        EXPECT_EQ(out->accepted, row.camera != std::string("none"));
        if (out->abandoned) {
            EXPECT_TRUE(out->body.isEmpty());
        } else if (row.error == QNetworkReply::NoError) {
            EXPECT_EQ(objects(out->body).isEmpty(), row.change == "malformed");
        }
        if (row.change == "wrong password") { // one challenge is answered, the second ends the call
            EXPECT_EQ(m_cameras.servedRequests().size(), 2);
        }
    }
    for (size_t i = 0; i < outcomes.size(); ++i) {
        EXPECT_TRUE(outcomes[i]->calls == 1 && outcomes[i]->thread == QThread::currentThread() &&
                    clients[i]->outstandingCount() == 0)
            << i;
    }
    QStringList local; // TLS may trust a self-signed certificate on the local network only
    for (const char* host :
         {"192.168.3.7", "172.20.0.1", "fe80::1", "LOCALHOST", "172.32.0.1", "8.8.8.8", "a.com"}) {
        local << (BraskHttpClient::isLocalNetworkHost(QLatin1String(host)) ? u"y"_s : u"n"_s);
    }
    EXPECT_EQ(local.join(QString()), u"yyyynnn"_s);
}

TEST_F(HttpCamerasTest, DestroyingTheClientCancelsRunningAndQueuedCallsAndOtherThreadsCallsEndOnItsThread)
{
    auto client = std::make_unique<BraskHttpClient>();
    std::shared_ptr<Outcome> other;
    std::thread([&] { other = get(*client, "door", window(1000, 1060)); }).join();
    ASSERT_TRUE(waitFor([&] { return other->calls > 0; }));
    EXPECT_EQ(other->error, QNetworkReply::NoError);
    EXPECT_EQ(other->thread, QThread::currentThread());

    m_cameras.setSlow("door", scaledMs(5000));
    auto running = get(*client, "door", window(1000, 1060));
    ASSERT_TRUE(waitFor([&] { return m_cameras.servedRequests().size() == 2; }));
    auto queued = get(*client, "door", window(1000, 1060)); // not started before the client goes
    client.reset();
    for (const auto& outcome : {running, queued}) {
        EXPECT_EQ(std::tuple(outcome->calls, outcome->error, outcome->abandoned),
                  std::tuple(1, QNetworkReply::OperationCanceledError, true));
    }
}

TEST_F(HttpCamerasTest, AnswersHoldTheWindowsObjectsTheSameEachTimeWithAThumbnail)
{
    BraskHttpClient client;
    const ObjectGenerator& generator = m_cameras.generator();
    const qint64 from = 1'700'000'000, to = from + 180;
    const QString camera = u"hall"_s;
    const QByteArray body = fetch(client, camera, window(from, to))->body;
    EXPECT_EQ(fetch(client, camera, window(from, to))->body, body);
    const QJsonArray list = objects(body);
    EXPECT_EQ(list.size(), generator.objectCount(camera, from, to, 50));
    EXPECT_NEAR(list.size(), 150, 3);
    int inMiddleMinute = 0;
    for (int i = 0; i < list.size(); ++i) {
        const qint64 start = list[i]["StartTime"].toInteger();
        EXPECT_TRUE(start >= from && start < to && list[i]["EndTime"].toInteger() > start) << start;
        inMiddleMinute += start >= from + 60 && start < from + 120 ? 1 : 0;
        const QJsonValue thumbnail = list[i]["Thumbnail"][0];
        EXPECT_EQ(thumbnail["feature"].toArray().size(), ObjectGenerator::kFeatureLength);
        // A real 8x16 RGB PNG: its pixel data inflates to 16 rows of a filter byte and 8 pixels.
        const QByteArray png = QByteArray::fromBase64(thumbnail["image"].toString().toLatin1());
        ASSERT_TRUE(png.startsWith("\x89PNG\r\n\x1a\n"));
        const QByteArray zlib =
            QByteArray::fromHex("00000190") + png.mid(41, qFromBigEndian<quint32>(png.data() + 33));
        EXPECT_EQ(qUncompress(zlib).size(), 16 * (1 + 3 * 8));
    }
    EXPECT_EQ(objects(fetch(client, camera, window(from + 60, from + 120))->body).size(), inMiddleMinute);
}
