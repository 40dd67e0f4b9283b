// Simulated cameras over real loopback HTTP: the paths, authentication, protection by access
// token, the answer format and its determinism, and the misbehaviour switches.
#include "CameraSimulator.h"
#include "BraskHttpClient.h"
#include "Zelto.h"

#include <QCoreApplication>
#include <QElapsedTimer>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QTcpServer>
#include <QUrl>
#include <QtEndian>
#include <gtest/gtest.h>

#include <cmath>
#include <vector>

namespace {

struct Answer
{
    QNetworkReply::NetworkError error = QNetworkReply::UnknownNetworkError;
    QByteArray body;
};

// The body features of up to `limit` objects, as plain vectors.
std::vector<std::vector<double>> features(const QJsonArray& objects, int limit)
{
    std::vector<std::vector<double>> result;
    for (int i = 0; i < objects.size() && i < limit; ++i) {
        const QJsonArray f = objects[i].toObject()["Thumbnail"].toArray()[0].toObject()["feature"].toArray();
        std::vector<double> v;
        for (const QJsonValue& x : f) {
            v.push_back(x.toDouble());
        }
        result.push_back(std::move(v));
    }
    return result;
}

double cosine(const std::vector<double>& a, const std::vector<double>& b)
{
    double dot = 0, na = 0, nb = 0;
    for (size_t i = 0; i < a.size(); ++i) {
        dot += a[i] * b[i];
        na += a[i] * a[i];
        nb += b[i] * b[i];
    }
    return dot / std::sqrt(na * nb);
}

class CameraSimulatorTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        CameraSetup plain;
        plain.name = QStringLiteral("door");
        plain.objectsPerMinute = 50;
        CameraSetup hall = plain;
        hall.name = QStringLiteral("hall");
        CameraSetup guarded = plain;
        guarded.name = QStringLiteral("vault");
        guarded.protectedMetadata = true;
        CameraSetup multi = plain;
        multi.name = QStringLiteral("yard");
        multi.channels = 2;
        ASSERT_TRUE(m_cameras.start({plain, hall, guarded, multi}));
    }

    Answer fetch(const QString& camera, const QString& path,
                 const QString& password = QStringLiteral("admin"))
    {
        Answer answer;
        bool done = false;
        m_client.Get(QStringLiteral("127.0.0.1"), path, m_cameras.port(camera), false,
                     QStringLiteral("admin"), password,
                     [&](QNetworkReply::NetworkError error, const QByteArray&, const QByteArray& body, bool) {
                         answer.error = error;
                         answer.body = body;
                         done = true;
                     },
                     20000, {});
        QElapsedTimer timer;
        timer.start();
        while (!done && timer.elapsed() < 10000) {
            QCoreApplication::processEvents(QEventLoop::AllEvents, 10);
        }
        EXPECT_TRUE(done);
        return answer;
    }

    static QJsonArray objects(const Answer& answer)
    {
        QJsonParseError error;
        const QJsonDocument document = QJsonDocument::fromJson(answer.body, &error);
        EXPECT_EQ(error.error, QJsonParseError::NoError);
        return document.object().value(QStringLiteral("ObjectMetaInfo")).toArray();
    }

    static QString window(qint64 start, qint64 end, const QString& prefix = QStringLiteral("/VCA"))
    {
        return QStringLiteral("%1/Data/DB/ObjectMeta?StartTime=%2&EndTime=%3&Info=127")
            .arg(prefix)
            .arg(start)
            .arg(end);
    }

    CameraSimulator m_cameras;
    BraskHttpClient m_client;
};

} // namespace

TEST_F(CameraSimulatorTest, AnswerHoldsWellFormedObjectsOfTheWindow)
{
    const Answer answer = fetch("door", window(1'700'000'000, 1'700'000'060));
    ASSERT_EQ(answer.error, QNetworkReply::NoError);
    const QJsonArray list = objects(answer);
    EXPECT_GE(list.size(), 49);
    EXPECT_LE(list.size(), 51);
    EXPECT_EQ(list.size(), m_cameras.generator().objectCount("door", 1'700'000'000, 1'700'000'060, 50));
    qint64 previousId = -1;
    for (const QJsonValue& value : list) {
        const QJsonObject object = value.toObject();
        const qint64 id = object.value("ID").toInteger();
        EXPECT_GT(id, previousId);
        previousId = id;
        const qint64 start = object.value("StartTime").toInteger();
        EXPECT_GE(start, 1'700'000'000);
        EXPECT_LT(start, 1'700'000'060);
        EXPECT_GT(object.value("EndTime").toInteger(), start);
        const QString type = object.value("ObjectType").toString();
        EXPECT_TRUE(type == "Human" || type == "Vehicle");
        EXPECT_TRUE(
            object.value("Attributes").toObject().contains(type == "Human" ? "Gender" : "PlateNumber"));
        EXPECT_EQ(object.value("Trajectory").toArray().size(), 4);
        const QJsonObject thumbnail = object.value("Thumbnail").toArray().first().toObject();
        EXPECT_EQ(thumbnail.value("feature").toArray().size(), 512);
        // A real PNG: signature, then an IHDR of 8x16 whose pixel data inflates to the right size.
        const QByteArray png = QByteArray::fromBase64(thumbnail.value("image").toString().toLatin1());
        ASSERT_TRUE(png.startsWith("\x89PNG\r\n\x1a\n"));
        EXPECT_EQ(png.mid(12, 4), "IHDR");
        EXPECT_EQ(qFromBigEndian<quint32>(png.constData() + 16), 8u);
        EXPECT_EQ(qFromBigEndian<quint32>(png.constData() + 20), 16u);
        const quint32 idatLength = qFromBigEndian<quint32>(png.constData() + 33);
        EXPECT_EQ(png.mid(37, 4), "IDAT");
        QByteArray zlib(4, '\0');
        qToBigEndian<quint32>(16 * (1 + 3 * 8), zlib.data());
        EXPECT_EQ(qUncompress(zlib + png.mid(41, int(idatLength))).size(), 16 * (1 + 3 * 8));
    }
}

TEST_F(CameraSimulatorTest, ObjectsAreDeterministicAndThePopulationReappearsAcrossCameras)
{
    const Answer first = fetch("door", window(1'700'000'000, 1'700'000'180));
    EXPECT_EQ(fetch("door", window(1'700'000'000, 1'700'000'180)).body, first.body);
    // A window inside the first one holds exactly the objects that start in it.
    const QJsonArray whole = objects(first);
    const QJsonArray part = objects(fetch("door", window(1'700'000'060, 1'700'000'120)));
    int inside = 0;
    for (const QJsonValue& v : whole) {
        const qint64 start = v.toObject().value("StartTime").toInteger();
        inside += (start >= 1'700'000'060 && start < 1'700'000'120) ? 1 : 0;
    }
    EXPECT_EQ(part.size(), inside);

    // The same identity on another camera looks alike; different identities do not.
    const QJsonArray other = objects(fetch("hall", window(1'700'000'000, 1'700'000'180)));
    const ObjectGenerator& generator = m_cameras.generator();
    const auto doorFeatures = features(whole, 60), hallFeatures = features(other, 60);
    int sameCompared = 0, differentCompared = 0;
    for (size_t i = 0; i < doorFeatures.size(); ++i) {
        const int a = generator.identityOf("door", 1'700'000'000, 1'700'000'180, 50, int(i));
        for (size_t j = 0; j < hallFeatures.size(); ++j) {
            const int b = generator.identityOf("hall", 1'700'000'000, 1'700'000'180, 50, int(j));
            const double similarity = cosine(doorFeatures[i], hallFeatures[j]);
            if (a == b) {
                EXPECT_GT(similarity, 0.8);
                ++sameCompared;
            } else if (differentCompared < 200) {
                EXPECT_LT(similarity, 0.3);
                ++differentCompared;
            }
        }
    }
    EXPECT_GT(sameCompared, 0);
    EXPECT_GT(differentCompared, 0);
}

TEST_F(CameraSimulatorTest, ProtectedCameraAnswersOnlyAValidAccessToken)
{
    EXPECT_EQ(fetch("vault", window(1000, 1060)).error, QNetworkReply::ContentAccessDenied);
    const QString tokenPath =
        QStringLiteral("/VCA/Data/DB/ObjMeta?accessToken=%1&StartTime=1000&EndTime=1060&Info=127");
    EXPECT_EQ(fetch("vault", tokenPath.arg("made-up")).error, QNetworkReply::ContentAccessDenied);

    const Answer pair =
        fetch("vault", "/VCA/Secure/Token?method=GET&resource=/Data/DB/ObjMeta&client=NOVIR2");
    ASSERT_EQ(pair.error, QNetworkReply::NoError);
    EXPECT_EQ(m_cameras.issuedPairTokens("vault"), QStringList{QString::fromUtf8(pair.body)});
    auto manager = Zelto::CreateProtectedAPIManager("", 0, true);
    manager->SetPairToken(pair.body.constData(), size_t(pair.body.size()), true);
    const QString token = QString::fromStdString(manager->GetAccessToken());
    const Answer granted = fetch("vault", tokenPath.arg(QString::fromLatin1(QUrl::toPercentEncoding(token))));
    EXPECT_EQ(granted.error, QNetworkReply::NoError);
    EXPECT_FALSE(objects(granted).isEmpty());
    // Unprotected cameras take the token path as well.
    EXPECT_EQ(fetch("door", tokenPath.arg(token)).error, QNetworkReply::NoError);

    const QList<ServedRequest> served = m_cameras.servedRequests();
    ASSERT_FALSE(served.isEmpty());
    EXPECT_EQ(served.last().camera, "door");
    EXPECT_TRUE(served.last().withAccessToken);
}

TEST_F(CameraSimulatorTest, ChannelsAuthenticationAndBadWindows)
{
    EXPECT_EQ(fetch("yard", window(1000, 1060, "/VCA/c1")).error, QNetworkReply::NoError);
    EXPECT_NE(fetch("yard", window(1000, 1060, "/VCA/c0")).body,
              fetch("yard", window(1000, 1060, "/VCA/c1")).body);
    EXPECT_EQ(fetch("yard", window(1000, 1060, "/VCA/c2")).error, QNetworkReply::ContentNotFoundError);
    EXPECT_EQ(fetch("door", window(1000, 1060, "/VCA/c0")).error, QNetworkReply::ContentNotFoundError);
    EXPECT_EQ(fetch("vault", window(1000, 1060), "wrong").error, QNetworkReply::AuthenticationRequiredError);
    EXPECT_EQ(fetch("door", window(1060, 1000)).error, QNetworkReply::ProtocolInvalidOperationError); // 400
    EXPECT_EQ(fetch("door", "/VCA/Data/DB/ObjectMeta?StartTime=x&EndTime=1").error,
              QNetworkReply::ProtocolInvalidOperationError);

    const QVariantMap directory = m_cameras.directoryMap();
    EXPECT_EQ(directory.keys(), (QStringList{"door", "hall", "vault", "yard-c0", "yard-c1"}));
    const QVariantMap channel = directory.value("yard-c1").toMap();
    EXPECT_EQ(channel.value("MultiChannelID").toString(), "1");
    EXPECT_EQ(channel.value("Port").toInt(), m_cameras.port("yard"));
    EXPECT_EQ(QByteArray::fromHex(channel.value("Password").toString().toLatin1()), "admin");
    EXPECT_TRUE(directory.value("vault").toMap().value("DelvixProtect").toBool());
    EXPECT_FALSE(directory.value("door").toMap().contains("MultiChannelID"));
}

TEST(CameraSimulatorPorts, FixedPortIsUsedAndATakenOneIsReported)
{
    quint16 free = 0;
    {
        QTcpServer probe;
        ASSERT_TRUE(probe.listen(QHostAddress::LocalHost, 0));
        free = probe.serverPort();
    }
    CameraSetup setup;
    setup.name = QStringLiteral("fixed");
    setup.port = free;
    CameraSimulator first;
    ASSERT_TRUE(first.start({setup}));
    EXPECT_EQ(first.port("fixed"), free);
    CameraSimulator second;
    QString error;
    EXPECT_FALSE(second.start({setup}, &error));
    EXPECT_TRUE(error.contains(QString::number(free))) << qPrintable(error);
    EXPECT_EQ(second.port("fixed"), 0);
}

TEST_F(CameraSimulatorTest, SwitchesMakeACameraFailMisbehaveOrSlow)
{
    m_cameras.setFailing("door", true);
    EXPECT_EQ(fetch("door", window(1000, 1060)).error, QNetworkReply::InternalServerError);
    EXPECT_EQ(fetch("hall", window(1000, 1060)).error, QNetworkReply::NoError);
    m_cameras.setFailing("door", false);

    m_cameras.setMalformed("door", true);
    const Answer broken = fetch("door", window(1000, 1060));
    EXPECT_EQ(broken.error, QNetworkReply::NoError);
    QJsonParseError error;
    QJsonDocument::fromJson(broken.body, &error);
    EXPECT_NE(error.error, QJsonParseError::NoError);
    m_cameras.setMalformed("door", false);

    m_cameras.setSlow("door", 300);
    QElapsedTimer timer;
    timer.start();
    EXPECT_EQ(fetch("door", window(1000, 1060)).error, QNetworkReply::NoError);
    EXPECT_GE(timer.elapsed(), 250);
}
