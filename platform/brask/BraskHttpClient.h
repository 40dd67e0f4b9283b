#pragma once
// IBraskHTTPClient over QNetworkAccessManager. Lives on the thread that creates it (which must
// run an event loop); Get may be called from any thread and is carried over to that one.

#include "IBraskHTTPClient.h"

#include <QHash>
#include <QObject>
#include <QPointer>
#include <QSslError>
#include <atomic>
#include <memory>

class QAuthenticator;
class QNetworkAccessManager;
class QTimer;

class BraskHttpClient : public QObject, public IBraskHTTPClient
{
    Q_OBJECT

public:
    struct Options
    {
        // Cameras on the local network almost always present self-signed certificates issued for
        // no particular name; refusing them would make HTTPS unusable there. When true, such
        // certificate errors are ignored for hosts given as loopback, private-use or link-local
        // addresses (and "localhost"); every other host is verified normally.
        bool acceptSelfSignedOnLocalNetwork = true;
        // A body larger than this ends the exchange with UnknownContentError (abandoned), so a
        // misbehaving peer cannot fill the plug-in's memory. 0: no limit.
        qint64 maxBodyBytes = 256 * 1024 * 1024;
    };

    BraskHttpClient();
    explicit BraskHttpClient(const Options& options);
    ~BraskHttpClient() override;

    bool Get(const QString& host, const QString& path, quint16 port, bool useSSL, const QString& user,
             const QString& password,
             std::function<void(QNetworkReply::NetworkError, const QByteArray&, const QByteArray&, bool)>
                 completion,
             unsigned int timeoutMs, const QList<QString>& list) override;

    // Exchanges started and not yet completed. Owner thread only.
    int outstandingCount() const { return int(m_exchanges.size()); }

    // True for the hosts that acceptSelfSignedOnLocalNetwork applies to.
    static bool isLocalNetworkHost(const QString& host);

private:
    class CompletionOnce;
    struct Exchange
    {
        std::shared_ptr<CompletionOnce> completion;
        QString user;
        QString password;
        QString host;
        bool authAnswered = false;
        bool timedOut = false;
        bool tooLarge = false;
        QTimer* timer = nullptr; // child of this client, deleted with the exchange
    };
    struct Call
    {
        QString host;
        QString path;
        quint16 port = 0;
        bool useSSL = false;
        QString user;
        QString password;
        unsigned int timeoutMs = 0;
        QList<QString> headers;
    };

    void start(const Call& call, const std::shared_ptr<CompletionOnce>& completion);
    void onFinished(QNetworkReply* reply);
    void onAuthenticationRequired(QNetworkReply* reply, QAuthenticator* authenticator);
    void onSslErrors(QNetworkReply* reply, const QList<QSslError>& errors);

    Options m_options;
    QNetworkAccessManager* m_manager = nullptr; // child of this client
    // Owner thread only: Get from other threads is queued over to that thread first.
    QHash<QNetworkReply*, Exchange> m_exchanges;
    std::atomic<bool> m_shuttingDown{false}; // set by the destructor, read by Get on any thread
};
