// The camera proxy over a recording HTTP client: composed paths, the per-camera queue and its
// drop rule, answers and failures, the pair-token exchange, and completions after the proxy is gone.
#include "CameraProxy.h"
#include "HostFakes.h"

#include <QSignalSpy>
#include <gtest/gtest.h>

namespace {

QString metaPath(qint64 start, qint64 end)
{
    return QStringLiteral("/VCA/Data/DB/ObjectMeta?StartTime=%1&EndTime=%2&Info=127").arg(start).arg(end);
}

struct CameraProxyTest : ::testing::Test
{
    QString send(const QString& camera, qint64 start, qint64 end, bool dropCovered = true,
                 QVariantMap extra = {})
    {
        QVariantMap request{{"cameraID", camera},
                            {"startTimestamp", start},
                            {"endTimestamp", end},
                            {"ip", "127.0.0.1"},
                            {"port", 8080},
                            {"username", "admin"},
                            {"password", "61646d696e"},
                            {"useSSL", false},
                            {"accessToken", QString()}};
        request.insert(extra);
        proxy->sendRequest(request, dropCovered);
        return request.value("path").toString();
    }
    // The last call as "user:password@host:port[ ssl] path".
    QString lastCall() const
    {
        const RecordingHttpClient::Call& c = client->calls.last();
        return QStringLiteral("%1:%2@%3:%4%5 %6")
            .arg(c.user, c.password, c.host)
            .arg(c.port)
            .arg(c.useSSL ? " ssl" : "", c.path);
    }

    std::shared_ptr<RecordingHttpClient> client = std::make_shared<RecordingHttpClient>();
    std::unique_ptr<CameraProxy> proxy = std::make_unique<CameraProxy>(client);
};

} // namespace

TEST_F(CameraProxyTest, ComposedPathsAndCredentials)
{
    const QString query = QStringLiteral("StartTime=100&EndTime=160&Info=127");
    const QString plain = "admin:admin@127.0.0.1:8080 /VCA/";
    const std::vector<std::pair<QVariantMap, QString>> rows{
        {{{"multiChannelID", 1}}, plain + "c1/Data/DB/ObjectMeta?" + query},
        {{{"accessToken", "AbZ09-_x"}, {"multiChannelID", "0"}, {"useSSL", true}},
         "admin:admin@127.0.0.1:8080 ssl /VCA/c0/Data/DB/ObjMeta?accessToken=AbZ09-_x&" + query},
        // Characters that mean something in a query cannot leak out of the token.
        {{{"accessToken", "a+b/c=&StartTime=0 %"}},
         plain + "Data/DB/ObjMeta?accessToken=a%2Bb%2Fc%3D%26StartTime%3D0%20%25&" + query},
        // Hexadecimal Latin-1 password: non-hex characters are skipped, bytes above 127 survive.
        {{{"password", "61:64-6dzE9"}},
         QString::fromLatin1("admin:adm\xe9@127.0.0.1:8080 /VCA/Data/DB/ObjectMeta?") + query},
        // A port that does not fit 16 bits is not narrowed into another one.
        {{{"port", 65536 + 80}}, "admin:admin@127.0.0.1:0 /VCA/Data/DB/ObjectMeta?" + query},
    };
    for (const auto& [extra, expected] : rows) {
        const QString path = send(QString::number(client->calls.size()), 100, 160, true, extra);
        EXPECT_EQ(lastCall() + u' ' + path, expected + u' ' + client->calls.last().path);
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
    for (int i : {0, 2, 3, 4}) {
        client->complete(i, QNetworkReply::NoError, "{}");
    }
    EXPECT_EQ(client->paths().mid(2),
              (QStringList{metaPath(100, 130), metaPath(130, 160), metaPath(100, 160), metaPath(90, 150)}));
    EXPECT_EQ(answers.size(), 4);

    // A failure empties only that camera's queue; the camera is idle again.
    send("a", 200, 260);
    send("a", 260, 320);
    send("b", 60, 120);
    client->complete(5, QNetworkReply::ConnectionRefusedError, QByteArray());
    EXPECT_EQ(client->calls.size(), 6);
    client->complete(1, QNetworkReply::NoError, "{}"); // b goes on
    send("a", 320, 380);
    EXPECT_EQ(client->paths().mid(6), (QStringList{metaPath(60, 120), metaPath(320, 380)}));
}

TEST_F(CameraProxyTest, AnswersCountObjectsAndUnusableAnswersFail)
{
    QSignalSpy answers(proxy.get(), &CameraProxy::receiveObjectMeta);
    QSignalSpy failed(proxy.get(), &CameraProxy::requestFailed);
    const std::tuple<QNetworkReply::NetworkError, QByteArray, int> rows[] = {
        // count -1: failed
        {QNetworkReply::NoError, "{\"ObjectMetaInfo\": []}", 0},
        {QNetworkReply::NoError, "{\"ObjectMetaInfo\":[{},{},{}]}", 3},
        {QNetworkReply::NoError, "{\"ObjectMetaInfo\":{\"ID\":1}}", 0},
        {QNetworkReply::NoError, "[1,2]", 0},
        {QNetworkReply::NoError, "{\"ObjectMetaInfo\": [", -1},
        {QNetworkReply::NoError, QByteArray(), -1},
        {QNetworkReply::ContentAccessDenied, "{}", -1}};
    for (const auto& [error, body, count] : rows) {
        const int i = client->calls.size();
        send(QString::number(i), 100, 160 + i);
        client->complete(i, error, body);
        // The request's own end, and the answer with its number of objects.
        EXPECT_EQ(count < 0 ? failed.last() : answers.last(),
                  count < 0 ? QList<QVariant>{QString::number(i)}
                            : (QList<QVariant>{QString::number(i), 160u + unsigned(i),
                                               QVariantMap{{"count", count}, {"data", body}}}))
            << body.constData();
    }
    EXPECT_EQ(answers.size() * 10 + failed.size(), 43);
}

TEST_F(CameraProxyTest, PairTokenExchangeBypassesTheQueue)
{
    const QVariantMap record{{"Name", "vault"},     {"IP", "10.0.0.5"},   {"Port", "8443"},
                             {"User", "op"},        {"Password", "7077"}, {"UseSSL", true},
                             {"MultiChannelID", 3}, {"Location", "Loc4"}};
    QSignalSpy tokens(proxy.get(), &CameraProxy::receivePairToken);
    send("vault", 0, 60);
    send("vault", 60, 120);
    proxy->sendPairTokenRequest(record); // goes out although a metadata request is outstanding
    ASSERT_EQ(client->calls.size(), 2);
    EXPECT_EQ(lastCall(),
              "op:pw@10.0.0.5:8443 ssl /VCA/Secure/Token?method=GET&resource=/Data/DB/ObjMeta&client=NOVIR2");
    client->complete(1, QNetworkReply::NoError, QString::fromUtf8("tok\xc3\xa9n").toUtf8());
    client->complete(0, QNetworkReply::NoError, "{}"); // the token answer did not advance the queue
    proxy->sendPairTokenRequest(record);
    client->complete(3, QNetworkReply::ConnectionRefusedError, QByteArray());
    EXPECT_EQ(tokens, (QList<QList<QVariant>>{{"vault", QString::fromUtf8("tok\xc3\xa9n")}}));
    EXPECT_EQ(client->paths().value(2), metaPath(60, 120));

    // Completions after the proxy is gone touch nothing.
    send("vault", 120, 180);
    proxy->sendPairTokenRequest(record);
    proxy.reset();
    client->complete(2, QNetworkReply::NoError, "{}");
    client->complete(4, QNetworkReply::NoError, "token");
    EXPECT_EQ(client->calls.size(), 5);
}
