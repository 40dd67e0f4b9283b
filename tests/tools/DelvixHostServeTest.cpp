// `delvix-host serve` as a person runs it: a real process, its HTTP API on loopback, streamed
// JSON lines, per-client sender handles, clear errors and a clean stop on SIGTERM.

#include <QCoreApplication>
#include <QElapsedTimer>
#include <QEventLoop>
#include <QFile>
#include <QJsonDocument>
#include <QJsonObject>
#include <QNetworkAccessManager>
#include <QNetworkReply>
#include <QProcess>
#include <QRegularExpression>
#include <QTemporaryDir>
#include <gtest/gtest.h>
#include <signal.h>

namespace {

// Instrumented builds run the same work several times slower; the build says how much.
#ifndef DELVIX_TEST_TIME_SCALE
#define DELVIX_TEST_TIME_SCALE 1
#endif
constexpr int kTimeScale = DELVIX_TEST_TIME_SCALE;

class ServeTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        ASSERT_TRUE(m_data.isValid());
        m_process.setProgram(QStringLiteral(DELVIX_HOST_PATH));
        m_process.setArguments({QStringLiteral("serve"), QStringLiteral("--data"), m_data.path(),
                                QStringLiteral("--listen"), QStringLiteral("127.0.0.1:0")});
        m_process.start();
        ASSERT_TRUE(m_process.waitForStarted());
        // The banner names the port the system gave us.
        QElapsedTimer timer;
        timer.start();
        QByteArray out;
        const QRegularExpression banner(QStringLiteral("http://127\\.0\\.0\\.1:(\\d+)"));
        while (timer.elapsed() < 20000 * kTimeScale) {
            m_process.waitForReadyRead(100);
            out += m_process.readAllStandardOutput();
            const QRegularExpressionMatch match = banner.match(QString::fromUtf8(out));
            if (match.hasMatch()) {
                m_port = match.captured(1).toUShort();
                break;
            }
        }
        ASSERT_NE(m_port, 0) << out.constData() << m_process.readAllStandardError().constData();
    }

    void TearDown() override
    {
        if (m_process.state() != QProcess::NotRunning) {
            m_process.kill();
            m_process.waitForFinished();
        }
    }

    struct Answer
    {
        int status = 0;
        QList<QJsonObject> lines;
        QByteArray raw;
    };

    Answer post(const QString& path, const QByteArray& body)
    {
        QNetworkRequest request(QUrl(QStringLiteral("http://127.0.0.1:%1%2").arg(m_port).arg(path)));
        request.setHeader(QNetworkRequest::ContentTypeHeader, QStringLiteral("application/json"));
        QNetworkReply* reply = m_network.post(request, body);
        QEventLoop loop;
        QObject::connect(reply, &QNetworkReply::finished, &loop, &QEventLoop::quit);
        loop.exec();
        Answer answer;
        answer.status = reply->attribute(QNetworkRequest::HttpStatusCodeAttribute).toInt();
        answer.raw = reply->readAll();
        for (const QByteArray& line : answer.raw.split('\n')) {
            if (!line.trimmed().isEmpty()) {
                answer.lines << QJsonDocument::fromJson(line).object();
            }
        }
        reply->deleteLater();
        return answer;
    }

    QTemporaryDir m_data;
    QProcess m_process;
    quint16 m_port = 0;
    QNetworkAccessManager m_network;
};

} // namespace

TEST_F(ServeTest, StreamsRepliesAsJsonLinesAndStopsCleanly)
{
    Answer answer = post(QStringLiteral("/request"), R"({"command":"noSuchCommand","client":"alice"})");
    EXPECT_EQ(answer.status, 200);
    ASSERT_EQ(answer.lines.size(), 1) << answer.raw.constData();
    EXPECT_EQ(answer.lines[0].value(QStringLiteral("code")).toString(),
              QStringLiteral("commandNotSupportError"));
    EXPECT_TRUE(answer.lines[0].value(QStringLiteral("final")).toBool());

    // A case made through the API: a progress line, then the final line with the case.
    answer = post(QStringLiteral("/addCaseWithItem?client=bob"),
                  R"({"caseName":"Theft","caseItem":{"nodeID":"cam1","needBookmark":false}})");
    ASSERT_EQ(answer.lines.size(), 2) << answer.raw.constData();
    EXPECT_FALSE(answer.lines[0].value(QStringLiteral("final")).toBool());
    EXPECT_EQ(answer.lines[1].value(QStringLiteral("payload")).toObject().value(QStringLiteral("caseName")),
              QStringLiteral("Theft"));

    // A command that sends no reply ends its answer after the wait, with no line.
    answer = post(QStringLiteral("/request"), R"({"command":"stopSearch","client":"bob","wait":0.2})");
    EXPECT_EQ(answer.status, 200);
    EXPECT_TRUE(answer.lines.isEmpty());

    EXPECT_EQ(post(QStringLiteral("/request"), "not json").status, 400);
    EXPECT_EQ(post(QStringLiteral("/request"), R"({"client":"x"})").status, 400);
    EXPECT_EQ(post(QStringLiteral("/getCaseList"), "{broken").status, 400);

    ::kill(pid_t(m_process.processId()), SIGTERM);
    ASSERT_TRUE(m_process.waitForFinished(20000 * kTimeScale));
    EXPECT_EQ(m_process.exitStatus(), QProcess::NormalExit);
    EXPECT_EQ(m_process.exitCode(), 0);
    EXPECT_TRUE(m_process.readAllStandardOutput().contains("stopping after"));
}

TEST(ServeArguments, RefusesNonLoopbackAddressesAndBadOptions)
{
    QTemporaryDir data;
    auto run = [&data](const QStringList& extra) {
        QProcess process;
        process.start(QStringLiteral(DELVIX_HOST_PATH),
                      QStringList{QStringLiteral("serve"), QStringLiteral("--data"), data.path()} + extra);
        process.waitForFinished(30000 * kTimeScale);
        return std::make_pair(process.exitCode(), process.readAllStandardError());
    };
    auto [code, err] = run({QStringLiteral("--listen"), QStringLiteral("0.0.0.0:8000")});
    EXPECT_NE(code, 0);
    EXPECT_TRUE(err.contains("loopback")) << err.constData();
    std::tie(code, err) = run({QStringLiteral("--listen"), QStringLiteral("nonsense")});
    EXPECT_EQ(code, 2);
    std::tie(code, err) = run({QStringLiteral("--site"), data.filePath(QStringLiteral("missing.json"))});
    EXPECT_NE(code, 0);
    EXPECT_FALSE(err.isEmpty());
}

TEST(DemoProgram, RunsTheWholeSystemAndReportsItComplete)
{
    QTemporaryDir data;
    QProcess process;
    process.start(QStringLiteral(DELVIX_HOST_PATH),
                  {QStringLiteral("demo"), QStringLiteral("--data"), data.filePath(QStringLiteral("demo"))});
    ASSERT_TRUE(process.waitForFinished(110000 * kTimeScale));
    const QByteArray out = process.readAllStandardOutput();
    EXPECT_EQ(process.exitCode(), 0) << out.constData() << process.readAllStandardError().constData();
    EXPECT_TRUE(out.contains("demo complete")) << out.constData();
    // Every step found something: cameras, stored objects, hits, sightings elsewhere, a case.
    for (const char* stepName : {"camera directory", "metadata synchronisation", "attribute search",
                                 "re-identification", "case workflow"}) {
        const QRegularExpression line(QStringLiteral("%1\\s+\\d+ ms\\s+(\\d+)").arg(QLatin1String(stepName)));
        const QRegularExpressionMatch match = line.match(QString::fromUtf8(out));
        ASSERT_TRUE(match.hasMatch()) << stepName;
        EXPECT_GT(match.captured(1).toInt(), 0) << stepName;
    }
    EXPECT_TRUE(out.contains("bookmarks left: 0"));
    EXPECT_TRUE(QFile::exists(data.filePath(QStringLiteral("demo/database/PluginDelvix/CaseVault.db"))));
}
