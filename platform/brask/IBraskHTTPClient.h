#pragma once
// The HTTP client the plug-in reaches cameras with.
//
// Contract:
// - Get starts one GET and returns at once. Its completion function is called exactly once per
//   call, whatever happens (answer, HTTP error status, refused connection, time-out, abort when the
//   client is destroyed, invalid arguments), and always on the thread that owns the client, never
//   from inside Get itself.
// - Completion arguments: Qt's network error code (NoError only for a 2xx answer), the response
//   headers as raw "Name: value" lines, the response body, and whether the exchange ended because
//   the client gave up (time-out or abort) rather than because the peer answered.
// - Get returns false when the arguments cannot make a request (empty host, port 0); the
//   completion function is still called, with QNetworkReply::ProtocolInvalidOperationError.
// - The client owns nothing of the caller's; the caller must make its completion function safe to
//   call after the caller is gone (a context check), because destroying the client completes every
//   outstanding call with OperationCanceledError.

#include <QByteArray>
#include <QList>
#include <QNetworkReply>
#include <QString>
#include <functional>

class IBraskHTTPClient
{
public:
    using Completion = std::function<void(QNetworkReply::NetworkError error, const QByteArray& headers,
                                          const QByteArray& body, bool abandoned)>;

    // path holds the path and the query, already percent-encoded where needed. user and password
    // answer a basic or digest challenge (never sent unasked); credentials a host accepted may be
    // reused for it until it challenges again. timeoutMs bounds the silence: the call ends with
    // TimeoutError when no byte arrived for that long; 0 means no limit. list: extra request headers as
    // "Name: value" texts.
    virtual bool
    Get(const QString& host, const QString& path, quint16 port, bool useSSL, const QString& user,
        const QString& password,
        std::function<void(QNetworkReply::NetworkError, const QByteArray&, const QByteArray&, bool)>
            completion,
        unsigned int timeoutMs, const QList<QString>& list) = 0;

    // After Get: a closed client library calls Get through the first slot of the table.
    virtual ~IBraskHTTPClient() = default;
};
