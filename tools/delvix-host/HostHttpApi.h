#pragma once
// The local HTTP API of `delvix-host serve`: one request per HTTP POST, its replies streamed
// back as JSON lines.
//
//   POST /request   body {"command": NAME, "params": VALUE, "client": NAME, "wait": SECONDS}
//   POST /NAME      body VALUE (the parameter), client from ?client=NAME or the X-Client header
//   GET  /health    {"ok": true}
//   GET  /host/memory   {"rssAnonKb": N, "heapBytes": N}: the server's anonymous resident memory
//                   and what its live allocations take (the load test follows both)
//   POST /host/databasePath   body {"path": FOLDER}: makes the folder and moves the server
//                   database path (and with it the case vault) there, the way the management
//                   server does; answers {"path": FOLDER}
//
// The answer is 200 with Content-Type application/x-ndjson in chunked transfer encoding: one
// line {"final", "code", "message", "payload"} per reply, as it arrives; the body ends with the
// final reply. A command that sends no reply at all (the stops, "retrieveDelvixData", an add with
// an empty item list) ends after "wait" seconds (default 2); any other waits for its final reply,
// ten minutes at most, however long it was queued behind other searches. A client name maps to
// one sender handle while the client has an answer open, so a client's "stopSearch" stops that
// client's own search. Bad requests get 400 with a text.
//
// Threads: lives on the host's main thread; replies arriving on other threads are handed to it.
// Listens on loopback addresses only.

#include <QAbstractHttpServer>
#include <QHash>
#include <QHostAddress>
#include <QPointer>
#include <memory>

class PluginHost;
class QTcpSocket;

class HostHttpApi : public QAbstractHttpServer
{
    Q_OBJECT
public:
    explicit HostHttpApi(PluginHost* host, QObject* parent = nullptr);

    // False with a reason when the address is not a loopback one or the port is taken.
    bool listenOn(const QHostAddress& address, quint16 port, QString* error);
    quint16 port() const { return m_port; }
    int requestsServed() const { return m_requestsServed; }

protected:
    bool handleRequest(const QHttpServerRequest& request, QTcpSocket* socket) override;
    void missingHandler(const QHttpServerRequest& request, QTcpSocket* socket) override;

private:
    void dispatch(QTcpSocket* socket, const QString& command, const QVariant& params, const QString& client,
                  double waitSeconds);
    void changeDatabasePath(const QByteArray& body, QTcpSocket* socket);
    std::shared_ptr<int> senderHandle(const QString& client);
    static void writeSimple(QTcpSocket* socket, int status, const QByteArray& contentType,
                            const QByteArray& body);

    PluginHost* m_host; // borrowed; outlives this server
    quint16 m_port = 0;
    int m_requestsServed = 0;
    // One address per client name while the client has a request open (its answers hold it), so
    // that its stop finds its search; the address is the client's sender handle. Entries of
    // clients with nothing open are dropped as the table doubles, so it follows the open clients.
    QHash<QString, std::weak_ptr<int>> m_clients;
    qsizetype m_clientsPruneAt = 64;
};
