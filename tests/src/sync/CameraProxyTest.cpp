// The camera proxy over a recording HTTP client: composed paths, the per-camera queue and its
// drop rule, answers and failures, the pair-token exchange, and completions that arrive after the
// proxy is gone.
#include "CameraProxy.h"
#include "FakeWemlo.h"
#include "HostFakes.h"
#include "LogFacility.h"

#include <QSignalSpy>
#include <gtest/gtest.h>

namespace {

QVariantMap window(const QString& camera, qint64 start, qint64 end)
{
    return QVariantMap{{"cameraID", camera},
                       {"startTimestamp", start},
                       {"endTimestamp", end},
                       {"ip", "127.0.0.1"},
                       {"port", 8080},
                       {"username", "admin"},
                       {"password", "61646d696e"},
                       {"useSSL", false},
                       {"accessToken", QString()}};
}

QString metaPath(qint64 start, qint64 end)
{
    return QStringLiteral("/VCA/Data/DB/ObjectMeta?StartTime=%1&EndTime=%2&Info=127").arg(start).arg(end);
}

class CameraProxyTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        fakeWemloReset();
        LogFacility::reload(FAKE_WEMLO_PATH);
    }
    void TearDown() override { fakeWemloReset(); }

    void send(const QString& camera, qint64 start, qint64 end, bool dropCovered = true)
    {
        QVariantMap request = window(camera, start, end);
        proxy->sendRequest(request, dropCovered);
    }
    static int logLines()
    {
        int count = 0;
        for (const FakeWemloLine& line : fakeWemloState().lines) {
            count += line.text.find(", Enter") == std::string::npos &&
                     line.text.find(", Leave") == std::string::npos;
        }
        return count;
    }

    std::shared_ptr<RecordingHttpClient> client = std::make_shared<RecordingHttpClient>();
    std::unique_ptr<CameraProxy> proxy = std::make_unique<CameraProxy>(client);
};

} // namespace

TEST_F(CameraProxyTest, ComposedPathsAndCredentials)
{
    struct Row
    {
        QVariantMap extra; // over the default window 100..160
        QString path;
        QString password;
        quint16 port;
    };
    const std::vector<Row> rows{
        {{}, metaPath(100, 160), "admin", 8080},
        {{{"multiChannelID", 1}},
         "/VCA/c1/Data/DB/ObjectMeta?StartTime=100&EndTime=160&Info=127",
         "admin",
         8080},
        {{{"multiChannelID", "0"}},
         "/VCA/c0/Data/DB/ObjectMeta?StartTime=100&EndTime=160&Info=127",
         "admin",
         8080},
        {{{"accessToken", "AbZ09-_x"}, {"multiChannelID", 2}},
         "/VCA/c2/Data/DB/ObjMeta?accessToken=AbZ09-_x&StartTime=100&EndTime=160&Info=127",
         "admin",
         8080},
        // Characters that mean something in a query cannot leak out of the token.
        {{{"accessToken", "a+b/c=&StartTime=0 %"}},
         "/VCA/Data/DB/"
         "ObjMeta?accessToken=a%2Bb%2Fc%3D%26StartTime%3D0%20%25&StartTime=100&EndTime=160&Info=127",
         "admin",
         8080},
        // Hexadecimal Latin-1 password: non-hex characters are skipped, bytes above 127 survive.
        {{{"password", "61:64-6dzE9"}}, metaPath(100, 160), QString::fromLatin1("adm\xe9"), 8080},
        // A port that does not fit 16 bits is not narrowed into another one.
        {{{"port", 65536 + 80}}, metaPath(100, 160), "admin", 0},
    };
    for (const Row& row : rows) {
        QVariantMap request = window(QString::number(client->calls.size()), 100, 160);
        request.insert(row.extra);
        proxy->sendRequest(request, true);
        const RecordingHttpClient::Call& call = client->calls.last();
        EXPECT_EQ(call.path, row.path);
        EXPECT_EQ(request.value("path").toString(), row.path);
        EXPECT_EQ(call.password, row.password);
        EXPECT_EQ(call.port, row.port);
        EXPECT_EQ(call.host, "127.0.0.1");
        EXPECT_EQ(call.user, "admin");
        EXPECT_FALSE(call.useSSL);
    }
}

TEST_F(CameraProxyTest, OneRequestInFlightPerCameraCoveredWindowsDroppedFailureEmptiesTheQueue)
{
    send("a", 40, 100);
    send("a", 100, 130); // queued even with an earlier end: the queue is empty
    send("b", 0, 60);    // another camera goes out at once
    send("a", 130, 160);
    send("a", 90, 150);        // ends before the last queued window: dropped
    send("a", 100, 160);       // equal end: queued
    send("a", 90, 150, false); // client-requested: never dropped
    EXPECT_EQ(client->paths(), (QStringList{metaPath(40, 100), metaPath(0, 60)}));

    // Each answer sends the next queued window of that camera, in order.
    QSignalSpy answers(proxy.get(), &CameraProxy::receiveObjectMeta);
    client->complete(0, QNetworkReply::NoError, "{}");
    for (int i = 2; i < 5; ++i) {
        client->complete(i, QNetworkReply::NoError, "{}");
    }
    EXPECT_EQ(client->paths().mid(2),
              (QStringList{metaPath(100, 130), metaPath(130, 160), metaPath(100, 160), metaPath(90, 150)}));
    EXPECT_EQ(answers.size(), 4);

    // A failure empties only that camera's queue; the camera is idle again.
    send("a", 200, 260);
    send("a", 260, 320);
    send("b", 60, 120);
    QSignalSpy failed(proxy.get(), &CameraProxy::requestFailed);
    client->complete(5, QNetworkReply::ConnectionRefusedError, QByteArray());
    ASSERT_EQ(failed.size(), 1);
    EXPECT_EQ(failed.first().first().toString(), "a");
    EXPECT_EQ(client->calls.size(), 6);
    client->complete(1, QNetworkReply::NoError, "{}"); // b goes on
    send("a", 320, 380);
    EXPECT_EQ(client->paths().mid(6), (QStringList{metaPath(60, 120), metaPath(320, 380)}));
}

TEST_F(CameraProxyTest, AnswersCountObjectsAndUnusableAnswersFail)
{
    QSignalSpy answers(proxy.get(), &CameraProxy::receiveObjectMeta);
    QSignalSpy failed(proxy.get(), &CameraProxy::requestFailed);
    const QByteArray bodies[] = {"{\"ObjectMetaInfo\": []}", "{\"ObjectMetaInfo\":[{},{},{}]}",
                                 "{\"ObjectMetaInfo\":{\"ID\":1}}", "[1,2]"};
    const int counts[] = {0, 3, 0, 0};
    for (int i = 0; i < 4; ++i) {
        send(QString::number(i), 100, 160 + i);
        client->complete(i, QNetworkReply::NoError, bodies[i]);
        ASSERT_EQ(answers.size(), i + 1);
        EXPECT_EQ(answers[i][0].toString(), QString::number(i));
        EXPECT_EQ(answers[i][1].toUInt(), 160u + unsigned(i)); // the request's own end
        EXPECT_EQ(answers[i][2].toMap(), (QVariantMap{{"count", counts[i]}, {"data", bodies[i]}}));
    }
    EXPECT_EQ(logLines(), 0);

    const std::pair<QNetworkReply::NetworkError, QByteArray> bad[] = {
        {QNetworkReply::NoError, "{\"ObjectMetaInfo\": ["},
        {QNetworkReply::NoError, QByteArray()},
        {QNetworkReply::ContentAccessDenied, "{}"}};
    for (const auto& [error, body] : bad) {
        send("x", 100, 160);
        client->complete(client->calls.size() - 1, error, body);
    }
    EXPECT_EQ(answers.size(), 4);
    EXPECT_EQ(failed.size(), 3);
    EXPECT_EQ(logLines(), 3); // each failure once
}

TEST_F(CameraProxyTest, PairTokenExchangeBypassesTheQueue)
{
    const QVariantMap record{{"Name", "vault"},     {"IP", "10.0.0.5"},   {"Port", "8443"},
                             {"User", "op"},        {"Password", "7077"}, {"UseSSL", true},
                             {"MultiChannelID", 3}, {"Location", "Loc4"}};
    EXPECT_EQ(proxy->composePairTokenRequest(record),
              (QVariantMap{{"path", "/VCA/Secure/Token?method=GET&resource=/Data/DB/ObjMeta&client=NOVIR2"},
                           {"cameraID", "vault"},
                           {"ip", "10.0.0.5"},
                           {"port", 8443},
                           {"username", "op"},
                           {"password", "pw"},
                           {"useSSL", true}}));

    QSignalSpy tokens(proxy.get(), &CameraProxy::receivePairToken);
    send("vault", 0, 60);
    send("vault", 60, 120);
    proxy->sendPairTokenRequest(record); // goes out although a metadata request is outstanding
    ASSERT_EQ(client->calls.size(), 2);
    EXPECT_EQ(client->calls[1].port, 8443);
    EXPECT_TRUE(client->calls[1].useSSL);
    client->complete(1, QNetworkReply::NoError, QString::fromUtf8("tok\xc3\xa9n").toUtf8());
    ASSERT_EQ(tokens.size(), 1);
    EXPECT_EQ(tokens[0][1].toString(), QString::fromUtf8("tok\xc3\xa9n"));
    EXPECT_EQ(client->calls.size(), 2); // the token answer did not advance the metadata queue

    proxy->sendPairTokenRequest(record);
    client->complete(2, QNetworkReply::ConnectionRefusedError, QByteArray());
    EXPECT_EQ(tokens.size(), 1);
    EXPECT_EQ(logLines(), 1);

    // Completions after the proxy is gone touch nothing.
    proxy->sendPairTokenRequest(record);
    proxy.reset();
    client->complete(0, QNetworkReply::NoError, "{}");
    client->complete(3, QNetworkReply::NoError, "token");
    EXPECT_EQ(client->calls.size(), 4);
}
