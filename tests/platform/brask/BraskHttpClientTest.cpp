// The HTTP client against simulated cameras on loopback: one completion per call whatever
// happens, Qt's error codes, both authentication schemes, HTTPS and the owner thread.
#include "BraskHttpClient.h"
#include "CameraSimulator.h"

#include <QCoreApplication>
#include <QElapsedTimer>
#include <QTcpServer>
#include <QThread>
#include <gtest/gtest.h>

#include <thread>

using namespace Qt::StringLiterals;

namespace {

struct Outcome
{
    int calls = 0;
    QNetworkReply::NetworkError error = QNetworkReply::NoError;
    QByteArray headers;
    QByteArray body;
    bool abandoned = false;
    QThread* thread = nullptr;
};

bool waitFor(const std::function<bool()>& condition, int limitMs = 10000)
{
    QElapsedTimer timer;
    timer.start();
    while (!condition() && timer.elapsed() < limitMs) {
        QCoreApplication::processEvents(QEventLoop::AllEvents, 10);
    }
    return condition();
}

// Lets queued work run for a moment, so a second completion would have had its chance.
void settle()
{
    QElapsedTimer timer;
    timer.start();
    while (timer.elapsed() < 50) {
        QCoreApplication::processEvents(QEventLoop::AllEvents, 10);
    }
}

class BraskHttpClientTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        CameraSetup basic;
        basic.name = u"basic"_s;
        basic.password = u"s3cret"_s;
        CameraSetup digest = basic;
        digest.name = u"digest"_s;
        digest.digestAuth = true;
        CameraSetup tls = basic;
        tls.name = u"tls"_s;
        tls.useSSL = true;
        CameraSetup guarded = basic;
        guarded.name = u"guarded"_s;
        guarded.protectedMetadata = true;
        QString error;
        ASSERT_TRUE(m_cameras.start({basic, digest, tls, guarded}, &error)) << qPrintable(error);
    }

    // The completion every call gets: it records what it was told, and on which thread.
    static BraskHttpClient::Completion recordInto(const std::shared_ptr<Outcome>& outcome)
    {
        return [outcome](QNetworkReply::NetworkError error, const QByteArray& headers, const QByteArray& body,
                         bool abandoned) {
            ++outcome->calls;
            outcome->error = error;
            outcome->headers = headers;
            outcome->body = body;
            outcome->abandoned = abandoned;
            outcome->thread = QThread::currentThread();
        };
    }

    std::shared_ptr<Outcome> get(BraskHttpClient& client, const QString& camera, const QString& path,
                                 const QString& password = u"s3cret"_s, unsigned int timeoutMs = 5000)
    {
        auto outcome = std::make_shared<Outcome>();
        client.Get(u"127.0.0.1"_s, path, m_cameras.port(camera), camera == "tls", u"admin"_s, password,
                   recordInto(outcome), timeoutMs, {});
        EXPECT_EQ(outcome->calls, 0) << "completion ran inside Get";
        return outcome;
    }

    std::shared_ptr<Outcome> fetch(BraskHttpClient& client, const QString& camera, const QString& path,
                                   const QString& password = u"s3cret"_s)
    {
        auto outcome = get(client, camera, path, password);
        EXPECT_TRUE(waitFor([&] { return outcome->calls > 0; }));
        settle();
        EXPECT_EQ(outcome->calls, 1);
        return outcome;
    }

    static QString window() { return u"/VCA/Data/DB/ObjectMeta?StartTime=1000&EndTime=1060&Info=127"_s; }

    CameraSimulator m_cameras;
};

} // namespace

TEST_F(BraskHttpClientTest, AnswersAndHttpErrorsCompleteOnceWithQtCodes)
{
    BraskHttpClient client;
    auto ok = fetch(client, "basic", window());
    EXPECT_EQ(ok->error, QNetworkReply::NoError);
    EXPECT_TRUE(ok->body.startsWith("{\"ObjectMetaInfo\":["));
    EXPECT_TRUE(ok->headers.contains("Content-Type: application/json"));
    EXPECT_FALSE(ok->abandoned);
    EXPECT_EQ(ok->thread, QThread::currentThread());

    BraskHttpClient stranger; // a client the camera has not accepted yet
    EXPECT_EQ(fetch(stranger, "basic", window(), "wrong")->error, QNetworkReply::AuthenticationRequiredError);
    EXPECT_EQ(fetch(client, "basic", "/VCA/nothing/here")->error, QNetworkReply::ContentNotFoundError);
    EXPECT_EQ(fetch(client, "guarded", window())->error, QNetworkReply::ContentAccessDenied);
    m_cameras.setFailing("basic", true);
    EXPECT_EQ(fetch(client, "basic", window())->error, QNetworkReply::InternalServerError);
    EXPECT_EQ(client.outstandingCount(), 0);
}

TEST_F(BraskHttpClientTest, DigestAuthenticationAnswersTheChallenge)
{
    BraskHttpClient client;
    auto ok = fetch(client, "digest", window());
    EXPECT_EQ(ok->error, QNetworkReply::NoError) << ok->body.constData();
    EXPECT_TRUE(ok->body.startsWith("{\"ObjectMetaInfo\""));
    BraskHttpClient stranger;
    EXPECT_EQ(fetch(stranger, "digest", window(), "wrong")->error,
              QNetworkReply::AuthenticationRequiredError);
}

TEST_F(BraskHttpClientTest, SelfSignedCertificateAcceptedOnLoopbackOnlyWhenAllowed)
{
    BraskHttpClient lenient;
    auto ok = fetch(lenient, "tls", window());
    EXPECT_EQ(ok->error, QNetworkReply::NoError);
    EXPECT_TRUE(ok->body.startsWith("{\"ObjectMetaInfo\""));

    BraskHttpClient::Options strict;
    strict.acceptSelfSignedOnLocalNetwork = false;
    BraskHttpClient verifying(strict);
    EXPECT_EQ(fetch(verifying, "tls", window())->error, QNetworkReply::SslHandshakeFailedError);

    for (const char* host : {"127.0.0.1", "192.168.3.7", "172.20.0.1", "fe80::1", "LOCALHOST"}) {
        EXPECT_TRUE(BraskHttpClient::isLocalNetworkHost(host)) << host;
    }
    for (const char* host : {"172.32.0.1", "8.8.8.8", "camera.example.com"}) {
        EXPECT_FALSE(BraskHttpClient::isLocalNetworkHost(host)) << host;
    }
}

TEST_F(BraskHttpClientTest, RefusedTimedOutAndInvalidCallsStillCompleteOnce)
{
    BraskHttpClient client;
    quint16 closedPort = 0;
    {
        QTcpServer probe;
        ASSERT_TRUE(probe.listen(QHostAddress::LocalHost, 0));
        closedPort = probe.serverPort();
    }
    auto refused = std::make_shared<Outcome>();
    client.Get("127.0.0.1", window(), closedPort, false, "admin", "x", recordInto(refused), 5000, {});
    ASSERT_TRUE(waitFor([&] { return refused->calls > 0; }));
    EXPECT_EQ(refused->error, QNetworkReply::ConnectionRefusedError);

    m_cameras.setSlow("basic", 3000);
    auto late = get(client, "basic", window(), "s3cret", 200);
    ASSERT_TRUE(waitFor([&] { return late->calls > 0; }, 2500));
    EXPECT_EQ(late->error, QNetworkReply::TimeoutError);
    EXPECT_TRUE(late->abandoned);

    auto invalid = std::make_shared<Outcome>();
    EXPECT_FALSE(client.Get("127.0.0.1", window(), 0, false, "", "", recordInto(invalid), 5000, {}));
    EXPECT_EQ(invalid->calls, 0);
    ASSERT_TRUE(waitFor([&] { return invalid->calls > 0; }));
    EXPECT_EQ(invalid->error, QNetworkReply::ProtocolInvalidOperationError);
    settle();
    EXPECT_EQ(refused->calls, 1);
    EXPECT_EQ(late->calls, 1);
    EXPECT_EQ(invalid->calls, 1);
}

TEST_F(BraskHttpClientTest, OversizedBodyIsRefused)
{
    BraskHttpClient::Options small;
    small.maxBodyBytes = 1000; // a window of objects is far larger
    BraskHttpClient client(small);
    auto outcome = fetch(client, "basic", window());
    EXPECT_EQ(outcome->error, QNetworkReply::UnknownContentError);
    EXPECT_TRUE(outcome->abandoned);
    EXPECT_TRUE(outcome->body.isEmpty());
}

TEST_F(BraskHttpClientTest, DestroyingTheClientCompletesEveryOutstandingCall)
{
    m_cameras.setSlow("basic", 2000);
    auto client = std::make_unique<BraskHttpClient>();
    auto running = get(*client, "basic", window());
    settle();                                      // started
    auto queued = get(*client, "basic", window()); // not started yet
    client.reset();
    EXPECT_EQ(running->calls, 1);
    EXPECT_EQ(running->error, QNetworkReply::OperationCanceledError);
    EXPECT_TRUE(running->abandoned);
    EXPECT_EQ(queued->calls, 1);
    EXPECT_EQ(queued->error, QNetworkReply::OperationCanceledError);
    settle();
    EXPECT_EQ(running->calls, 1);
}

TEST_F(BraskHttpClientTest, CallFromAnotherThreadCompletesOnTheOwnerThread)
{
    BraskHttpClient client;
    std::shared_ptr<Outcome> outcome;
    std::thread other([&] { outcome = get(client, "basic", window()); });
    other.join();
    ASSERT_TRUE(waitFor([&] { return outcome->calls > 0; }));
    EXPECT_EQ(outcome->error, QNetworkReply::NoError);
    EXPECT_EQ(outcome->thread, QThread::currentThread());
}
