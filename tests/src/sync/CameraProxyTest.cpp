// The camera proxy over a recording HTTP client: composed paths, the per-camera queue and its
// drop rule, answers and failures with their log lines, the pair-token exchange, and completions
// that arrive after the proxy is gone.
#include "CameraProxy.h"
#include "FakeWemlo.h"
#include "LogFacility.h"
#include "RecordingHttpClient.h"

#include <QSignalSpy>
#include <gtest/gtest.h>

namespace {

class CameraProxyTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        fakeWemloReset();
        LogFacility::reload(FAKE_WEMLO_PATH);
        m_client = std::make_shared<RecordingHttpClient>();
        m_proxy = std::make_unique<CameraProxy>(m_client);
    }
    void TearDown() override { fakeWemloReset(); }

    static QVariantMap window(const QString& camera, qint64 start, qint64 end)
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

    // Sends a window and returns the composed map.
    QVariantMap send(const QString& camera, qint64 start, qint64 end, bool dropCovered = true)
    {
        QVariantMap request = window(camera, start, end);
        m_proxy->sendRequest(request, dropCovered);
        return request;
    }

    static std::vector<std::string> logLines()
    {
        std::vector<std::string> lines;
        for (const FakeWemloLine& line : fakeWemloState().lines) {
            if (line.text.find(", Enter") == std::string::npos &&
                line.text.find(", Leave") == std::string::npos) {
                lines.push_back(line.text);
            }
        }
        return lines;
    }

    std::shared_ptr<RecordingHttpClient> m_client;
    std::unique_ptr<CameraProxy> m_proxy;
};

QString metaPath(qint64 start, qint64 end)
{
    return QStringLiteral("/VCA/Data/DB/ObjectMeta?StartTime=%1&EndTime=%2&Info=127").arg(start).arg(end);
}

} // namespace

TEST_F(CameraProxyTest, ComposesPathsForChannelTokenAndNone)
{
    QVariantMap plain = send("a", 100, 160);
    EXPECT_EQ(plain.value("path").toString(), "/VCA/Data/DB/ObjectMeta?StartTime=100&EndTime=160&Info=127");
    EXPECT_EQ(plain.value("password").toString(), "admin");

    QVariantMap channel = window("b", 100, 160);
    channel.insert("multiChannelID", 1);
    m_proxy->sendRequest(channel, true);
    EXPECT_EQ(channel.value("path").toString(),
              "/VCA/c1/Data/DB/ObjectMeta?StartTime=100&EndTime=160&Info=127");
    QVariantMap zero = window("c", 100, 160);
    zero.insert("multiChannelID", "0");
    m_proxy->sendRequest(zero, true);
    EXPECT_TRUE(zero.value("path").toString().startsWith("/VCA/c0/Data/DB/ObjectMeta?"));

    QVariantMap urlSafe = window("d", 100, 160);
    urlSafe.insert("accessToken", "AbZ09-_x");
    urlSafe.insert("multiChannelID", 2);
    m_proxy->sendRequest(urlSafe, true);
    EXPECT_EQ(urlSafe.value("path").toString(),
              "/VCA/c2/Data/DB/ObjMeta?accessToken=AbZ09-_x&StartTime=100&EndTime=160&Info=127");
    // Characters that mean something in a query cannot leak out of the token.
    QVariantMap unsafe = window("e", 100, 160);
    unsafe.insert("accessToken", "a+b/c=&StartTime=0 %");
    m_proxy->sendRequest(unsafe, true);
    EXPECT_EQ(unsafe.value("path").toString(),
              "/VCA/Data/DB/"
              "ObjMeta?accessToken=a%2Bb%2Fc%3D%26StartTime%3D0%20%25&StartTime=100&EndTime=160&Info=127");

    // Hexadecimal Latin-1 password: non-hex characters are skipped, bytes above 127 survive.
    QVariantMap odd = window("f", 100, 160);
    odd.insert("password", "61:64-6dzE9");
    m_proxy->sendRequest(odd, true);
    EXPECT_EQ(odd.value("password").toString(), QString::fromLatin1("adm\xe9"));

    ASSERT_EQ(m_client->calls.size(), 6);
    const RecordingHttpClient::Call& first = m_client->calls.first();
    EXPECT_EQ(first.host, "127.0.0.1");
    EXPECT_EQ(first.port, 8080);
    EXPECT_EQ(first.user, "admin");
    EXPECT_EQ(first.password, "admin");
    EXPECT_FALSE(first.useSSL);
    EXPECT_EQ(first.timeoutMs, 30000u);
    EXPECT_EQ(m_client->calls.last().password, QString::fromLatin1("adm\xe9"));

    // A port that does not fit 16 bits is not narrowed into another one.
    QVariantMap wide = window("g", 100, 160);
    wide.insert("port", 65536 + 80);
    m_proxy->sendRequest(wide, true);
    EXPECT_EQ(m_client->calls.last().port, 0);
}

TEST_F(CameraProxyTest, OneRequestInFlightPerCameraAndCoveredWindowsDropped)
{
    send("a", 40, 100);
    send("a", 100, 130); // queued even with an earlier end: the queue is empty
    send("b", 0, 60);    // another camera goes out at once
    EXPECT_EQ(m_client->paths(), (QStringList{metaPath(40, 100), metaPath(0, 60)}));

    send("a", 130, 160);
    send("a", 90, 150);        // ends before the last queued window: dropped
    send("a", 100, 160);       // equal end: queued
    send("a", 90, 150, false); // client-requested: never dropped
    EXPECT_EQ(m_client->calls.size(), 2);

    // Each answer sends the next queued window of that camera, in order.
    QSignalSpy answers(m_proxy.get(), &CameraProxy::receiveObjectMeta);
    const QStringList expected{metaPath(100, 130), metaPath(130, 160), metaPath(100, 160), metaPath(90, 150)};
    int index = 0;
    for (const QString& path : expected) {
        m_client->complete(index == 0 ? 0 : m_client->calls.size() - 1, QNetworkReply::NoError, "{}");
        ASSERT_EQ(m_client->calls.last().path, path);
        index++;
    }
    m_client->complete(m_client->calls.size() - 1, QNetworkReply::NoError, "{}");
    EXPECT_EQ(answers.size(), 5);
    // Idle again: the next window goes out at once.
    send("a", 160, 220);
    EXPECT_EQ(m_client->calls.last().path, metaPath(160, 220));
}

TEST_F(CameraProxyTest, FailureEmptiesOnlyThatCamerasQueue)
{
    send("a", 0, 60);
    send("a", 60, 120);
    send("a", 120, 180);
    send("b", 0, 60);
    send("b", 60, 120);
    QSignalSpy failed(m_proxy.get(), &CameraProxy::requestFailed);
    QSignalSpy answers(m_proxy.get(), &CameraProxy::receiveObjectMeta);

    m_client->complete(0, QNetworkReply::ConnectionRefusedError, QByteArray());
    ASSERT_EQ(failed.size(), 1);
    EXPECT_EQ(failed.first().first().toString(), "a");
    EXPECT_EQ(answers.size(), 0);
    EXPECT_EQ(m_client->calls.size(), 2); // nothing more for a

    m_client->complete(1, QNetworkReply::NoError, "{\"ObjectMetaInfo\":[]}");
    ASSERT_EQ(m_client->calls.size(), 3);
    EXPECT_EQ(m_client->calls.last().path, metaPath(60, 120)); // b goes on
    send("a", 0, 60);                                          // a is idle
    EXPECT_EQ(m_client->calls.size(), 4);
}

TEST_F(CameraProxyTest, AnswersCountObjectsAndFailuresAreLoggedOnce)
{
    QSignalSpy answers(m_proxy.get(), &CameraProxy::receiveObjectMeta);
    QSignalSpy failed(m_proxy.get(), &CameraProxy::requestFailed);
    const QByteArray bodies[] = {"{\"ObjectMetaInfo\": []}", "{\"ObjectMetaInfo\":[{},{},{}]}",
                                 "{\"ObjectMetaInfo\":{\"ID\":1}}", "[1,2]"};
    for (int i = 0; i < 4; ++i) {
        send(QString::number(i), 100, 160 + i);
        m_client->complete(i, QNetworkReply::NoError, bodies[i]);
    }
    ASSERT_EQ(answers.size(), 4);
    const int counts[] = {0, 3, 0, 0};
    for (int i = 0; i < 4; ++i) {
        EXPECT_EQ(answers[i][0].toString(), QString::number(i));
        EXPECT_EQ(answers[i][1].toUInt(), 160u + unsigned(i)); // the request's own end
        const QVariantMap data = answers[i][2].toMap();
        EXPECT_EQ(data.value("count").toInt(), counts[i]);
        EXPECT_EQ(data.value("data").toByteArray(), bodies[i]);
    }
    EXPECT_TRUE(logLines().empty());

    send("x", 100, 160);
    m_client->complete(4, QNetworkReply::NoError, "{\"ObjectMetaInfo\": [");
    send("y", 100, 160);
    m_client->complete(5, QNetworkReply::NoError, QByteArray());
    send("z", 100, 160);
    m_client->complete(6, QNetworkReply::ContentAccessDenied, "{}");
    EXPECT_EQ(answers.size(), 4);
    EXPECT_EQ(failed.size(), 3);
    const std::vector<std::string> lines = logLines();
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_NE(
        lines[0].find("CameraProxy::handleHttpResponse, Get camera x object meta failed, network error: 0, "
                      "parse error: "),
        std::string::npos);
    EXPECT_NE(lines[0].find("request: /VCA/Data/DB/ObjectMeta?StartTime=100&EndTime=160&Info=127"),
              std::string::npos);
    EXPECT_NE(lines[1].find("Get camera y object meta failed"), std::string::npos);
    EXPECT_EQ(lines[2],
              "CameraProxy::handleHttpResponse, Get camera z object meta failed with access token, please "
              "check camera time and server time is synchronized.");
}

TEST_F(CameraProxyTest, PairTokenExchangeBypassesTheQueue)
{
    const QVariantMap record{{"Name", "vault"},     {"IP", "10.0.0.5"},   {"Port", "8443"},
                             {"User", "op"},        {"Password", "7077"}, {"UseSSL", true},
                             {"MultiChannelID", 3}, {"Location", "Loc4"}};
    const QVariantMap composed = m_proxy->composePairTokenRequest(record);
    EXPECT_EQ(composed,
              (QVariantMap{{"path", "/VCA/Secure/Token?method=GET&resource=/Data/DB/ObjMeta&client=NOVIR2"},
                           {"cameraID", "vault"},
                           {"ip", "10.0.0.5"},
                           {"port", 8443},
                           {"username", "op"},
                           {"password", "pw"},
                           {"useSSL", true}}));
    EXPECT_EQ(composed.value("port").typeId(), QMetaType::Int);

    QSignalSpy tokens(m_proxy.get(), &CameraProxy::receivePairToken);
    send("vault", 0, 60);
    send("vault", 60, 120);
    m_proxy->sendPairTokenRequest(record); // goes out although a metadata request is outstanding
    ASSERT_EQ(m_client->calls.size(), 2);
    EXPECT_EQ(m_client->calls[1].port, 8443);
    EXPECT_TRUE(m_client->calls[1].useSSL);
    m_client->complete(1, QNetworkReply::NoError, QString::fromUtf8("tok\xc3\xa9n").toUtf8());
    ASSERT_EQ(tokens.size(), 1);
    EXPECT_EQ(tokens[0][1].toString(), QString::fromUtf8("tok\xc3\xa9n"));
    EXPECT_EQ(m_client->calls.size(), 2); // the token answer did not advance the metadata queue

    m_proxy->sendPairTokenRequest(record);
    m_client->complete(2, QNetworkReply::ConnectionRefusedError, QByteArray());
    EXPECT_EQ(tokens.size(), 1);
    const std::vector<std::string> lines = logLines();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0],
              "CameraProxy::handlePairTokenHttpResponse, Get camera vault token failed, network error: 1");
}

TEST_F(CameraProxyTest, CompletionAfterTheProxyIsGoneTouchesNothing)
{
    send("a", 0, 60);
    send("a", 60, 120);
    m_proxy->sendPairTokenRequest(QVariantMap{{"Name", "a"}, {"IP", "127.0.0.1"}, {"Port", 1}});
    m_proxy.reset();
    m_client->complete(0, QNetworkReply::NoError, "{}");
    m_client->complete(1, QNetworkReply::NoError, "token");
    EXPECT_EQ(m_client->calls.size(), 2);
}
