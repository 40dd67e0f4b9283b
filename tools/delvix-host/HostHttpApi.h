#pragma once
// The local HTTP API of `delvix-host serve`: one request per HTTP POST, its replies streamed
// back as JSON lines.
//
//   POST /request   body {"command": NAME, "params": VALUE, "client": NAME, "wait": SECONDS}
//   POST /NAME      body VALUE (the parameter), client from ?client=NAME or the X-Client header
//   GET  /          the explorer page (explorer/ beside this file, built in as Qt resources);
//                   GET /explorer/FILE its script and style
//   GET  /health    {"ok": true}
//   GET  /host/cameras   {"cameras": [...], "notInDirectory": [...], "vocabulary": {...}}: the
//                   camera directory the plug-in learned, the site's cameras it left out and why,
//                   and the words for the site's attribute codes
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

#include "NovirSite.h"

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
    // The site whose cameras and vocabulary /host/cameras tells (the built-in site until set).
    void setSite(const NovirSite& site) { m_site = site; }
    int requestsServed() const { return m_requestsServed; }

protected:
    bool handleRequest(const QHttpServerRequest& request, QTcpSocket* socket) override;
    void missingHandler(const QHttpServerRequest& request, QTcpSocket* socket) override;

private:
    void dispatch(QTcpSocket* socket, const QString& command, const QVariant& params, const QString& client,
                  double waitSeconds);
    void changeDatabasePath(const QByteArray& body, QTcpSocket* socket);
    QByteArray camerasReport() const;
    static bool serveExplorer(const QString& path, QTcpSocket* socket);
    std::shared_ptr<int> senderHandle(const QString& client);
    static void writeSimple(QTcpSocket* socket, int status, const QByteArray& contentType,
                            const QByteArray& body);

    PluginHost* m_host; // borrowed; outlives this server
    NovirSite m_site = NovirSite::defaultSite();
    quint16 m_port = 0;
    int m_requestsServed = 0;
    // One address per client name while the client has a request open (its answers hold it), so
    // that its stop finds its search; the address is the client's sender handle. Entries of
    // clients with nothing open are dropped as the table doubles, so it follows the open clients.
    QHash<QString, std::weak_ptr<int>> m_clients;
    qsizetype m_clientsPruneAt = 64;
};
