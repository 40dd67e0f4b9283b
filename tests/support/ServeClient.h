#pragma once
// Drives `delvix-host serve` as a separate process: starts it on a data folder on a free loopback
// port, posts commands to its HTTP API and reads the streamed JSON lines, stops it with SIGTERM or
// kills it with SIGKILL; and reads a case vault file the way a person checks it afterwards.
//
// Threads: a ServeProcess and a ServeConnection belong to the thread that made them (each client
// thread makes its own connection). Every limit is scaled for the build (TestWait.h).

#include <QHash>
#include <QJsonObject>
#include <QNetworkAccessManager>
#include <QNetworkReply>
#include <QProcess>
#include <QThread>
#include <functional>
#include <memory>
#include <vector>

// One answer of the API, filled as its lines arrive.
struct ServeAnswer
{
    bool done = false;
    int status = 0;
    QNetworkReply::NetworkError error = QNetworkReply::NoError;
    QList<QJsonObject> lines;

    int finalCount() const;
    // The final line's code and payload (empty without one); the final line is the last.
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
    // POST `body` to `path` ("/request", "/getCaseList?client=x"); the answer fills in while this
    // thread's event loop turns.
    ServeAnswerPtr post(const QString& path, const QByteArray& body);
    // POST /request; `wait` is how long the API waits for a first reply.
    ServeAnswerPtr request(const QString& command, const QJsonValue& params, const QString& client,
                           double wait = 60.0);
    // Posts and waits for the answer to end.
    ServeAnswer call(const QString& command, const QJsonValue& params,
                     const QString& client = QStringLiteral("test"), double wait = 60.0);
    static bool wait(const QList<ServeAnswerPtr>& answers);

private:
    quint16 m_port;
    QNetworkAccessManager m_network;
};

// Its stderr goes to the test's, so that a failing test shows what the server said.
class ServeProcess
{
public:
    ~ServeProcess();
    // Starts serve on `dataDir` (also its working directory) and waits until it listens.
    bool start(const QString& dataDir, const QStringList& extra = {});
    quint16 port() const { return m_port; }
    ServeConnection& http() { return *m_http; }
    // SIGTERM: true when it ended by itself with status 0. SIGKILL: true when it died of it.
    bool stop();
    bool kill();
    // "stopping after N request(s)" once stopped, else -1.
    int requestsServed();
    // A field of /proc/PID/status in kB ("VmRSS", "VmHWM"); 0 when unreadable.
    qint64 memoryKb(const char* field) const;

private:
    QProcess m_process;
    QByteArray m_output;
    quint16 m_port = 0;
    std::unique_ptr<ServeConnection> m_http;
};

// Threads running body(index), always joined before they go (a QThread destroyed while it runs
// ends the program).
class ClientThreads
{
public:
    ClientThreads(int count, const std::function<void(int)>& body);
    ~ClientThreads();
    // Waits, turning this thread's event loop, until every body returned.
    bool join(int limitMs);

private:
    std::vector<std::unique_ptr<QThread>> m_threads;
};

// One case item as a client sends it and as the vault keeps it.
struct CaseEntry
{
    int caseId = 0;
    QString caseName;
    QString nodeId;
    QString locId;
    qint64 start = 0;
    qint64 end = 0;
    int type = 0;
    bool needBookmark = false;

    QJsonObject itemJson() const;
    // Same item; case id and name compared only when both have one.
    bool sameItem(const CaseEntry& other) const;
};

// The items of a vault file with their cases, by start time (unique in these tests), after an
// integrity check. Opened read-write: the first opener after a crash rolls back what was left
// unfinished. False with the reason.
bool readVault(const QString& file, QHash<qint64, CaseEntry>* items, QString* error);
