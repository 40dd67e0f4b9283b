#pragma once
// Drives `delvix-host serve` as a separate process on a free loopback port: posts to its HTTP API
// and reads the streamed JSON lines, stops it with SIGTERM or kills it; and reads a case vault the
// way a person checks it afterwards. A connection belongs to the thread that made it.

#include <QHash>
#include <QJsonObject>
#include <QNetworkAccessManager>
#include <QNetworkReply>
#include <QProcess>
#include <csignal>
#include <functional>
#include <memory>
#include <thread>
#include <vector>

// One answer of the API, filled as its lines arrive.
struct ServeAnswer
{
    bool done = false;
    int status = 0;
    QNetworkReply::NetworkError error = QNetworkReply::NoError;
    QList<QJsonObject> lines;

    int finalCount() const;
    // The final line is the last.
    QString code() const { return finalCount() ? lines.last()["code"].toString() : QString(); }
    QJsonValue payload() const { return finalCount() ? lines.last()["payload"] : QJsonValue(); }
};
using ServeAnswerPtr = std::shared_ptr<ServeAnswer>;

class ServeConnection
{
public:
    explicit ServeConnection(quint16 port)
        : m_port(port)
    {}
    // The answer fills in while this thread's event loop turns.
    ServeAnswerPtr post(const QString& path, const QByteArray& body);
    // POST /request; `wait` is how long the API waits for a first reply.
    ServeAnswerPtr request(const QString& command, const QJsonValue& params, const QString& client,
                           double wait = 60.0);
    ServeAnswer call(const QString& command, const QJsonValue& params, const QString& client = "test",
                     double wait = 60.0);
    static bool wait(const ServeAnswerPtr& answer);

private:
    quint16 m_port;
    QNetworkAccessManager m_network;
};

// Its stderr goes to the test's, so that a failing test shows what the server said.
class ServeProcess
{
public:
    ~ServeProcess();
    bool start(const QString& dataDir, const QStringList& extra = {});
    quint16 port() const { return m_port; }
    ServeConnection& http() { return *m_http; }
    // SIGTERM: true when it ended by itself with status 0. SIGKILL: true when it died of it.
    bool stop()
    {
        return signal(SIGTERM) && m_process.exitStatus() == QProcess::NormalExit && !m_process.exitCode();
    }
    bool kill() { return signal(SIGKILL) && m_process.exitStatus() == QProcess::CrashExit; }
    // "stopping after N request(s)" once stopped, else -1.
    int requestsServed();
    // A field of /proc/PID/status in kB ("VmRSS", "VmHWM"); 0 when unreadable.
    qint64 memoryKb(const char* field) const;

private:
    bool signal(int number);
    QProcess m_process;
    QByteArray m_output;
    quint16 m_port = 0;
    std::unique_ptr<ServeConnection> m_http;
};

// Threads running body(index), joined when this goes.
struct ClientThreads
{
    ClientThreads(int count, const std::function<void(int)>& body);
    ~ClientThreads();
    std::vector<std::thread> threads;
};

// One case item as a client sends it and as the vault keeps it.
struct CaseEntry
{
    int caseId = 0;
    QString caseName, nodeId, locId;
    qint64 start = 0, end = 0;
    int type = 0;
    bool needBookmark = false;

    QJsonObject itemJson() const;
    // Same item; case id and name compared only when both have one.
    bool sameItem(const CaseEntry& other) const;
};

// The items of a vault file with their cases by start time (unique in these tests), after an
// integrity check; opened read-write, so that a crash's unfinished work is rolled back first.
bool readVault(const QString& file, QHash<qint64, CaseEntry>* items, QString* error);
