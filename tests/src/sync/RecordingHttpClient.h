#pragma once
// An HTTP client that only records calls; the test decides when and how each one completes.

#include "IBraskHTTPClient.h"

#include <QList>

class RecordingHttpClient : public IBraskHTTPClient
{
public:
    struct Call
    {
        QString host;
        QString path;
        quint16 port = 0;
        bool useSSL = false;
        QString user;
        QString password;
        Completion completion;
        unsigned int timeoutMs = 0;
        bool completed = false;
    };

    bool Get(const QString& host, const QString& path, quint16 port, bool useSSL, const QString& user,
             const QString& password,
             std::function<void(QNetworkReply::NetworkError, const QByteArray&, const QByteArray&, bool)>
                 completion,
             unsigned int timeoutMs, const QList<QString>&) override
    {
        calls.append(Call{host, path, port, useSSL, user, password, std::move(completion), timeoutMs, false});
        return true;
    }

    // Completes call `index` (once).
    void complete(int index, QNetworkReply::NetworkError error, const QByteArray& body)
    {
        Call& call = calls[index];
        if (call.completed) {
            return;
        }
        call.completed = true;
        Completion completion = call.completion;
        completion(error, QByteArray(), body, false);
    }

    QStringList paths() const
    {
        QStringList result;
        for (const Call& call : calls) {
            result << call.path;
        }
        return result;
    }

    QList<Call> calls;
};
