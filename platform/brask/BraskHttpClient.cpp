#include "BraskHttpClient.h"

#include <QAuthenticator>
#include <QHostAddress>
#include <QNetworkAccessManager>
#include <QNetworkRequest>
#include <QThread>
#include <QTimer>
#include <QUrl>

// Wraps a completion function so that it runs exactly once: explicitly, or with
// OperationCanceledError when the last holder lets go without having called it (a queued start
// that was discarded because the client went away).
class BraskHttpClient::CompletionOnce
{
public:
    explicit CompletionOnce(IBraskHTTPClient::Completion completion)
        : m_completion(std::move(completion))
    {}
    ~CompletionOnce() { call(QNetworkReply::OperationCanceledError, QByteArray(), QByteArray(), true); }

    void call(QNetworkReply::NetworkError error, const QByteArray& headers, const QByteArray& body,
              bool abandoned)
    {
        if (!m_completion) {
            return;
        }
        // Moved out first: the function may start another Get or drop the last reference to us.
        IBraskHTTPClient::Completion completion = std::move(m_completion);
        m_completion = nullptr;
        completion(error, headers, body, abandoned);
    }

private:
    IBraskHTTPClient::Completion m_completion;
};

BraskHttpClient::BraskHttpClient()
    : BraskHttpClient(Options())
{}

BraskHttpClient::BraskHttpClient(const Options& options)
    : m_options(options)
    , m_manager(new QNetworkAccessManager(this))
{
    connect(m_manager, &QNetworkAccessManager::finished, this, &BraskHttpClient::onFinished);
    connect(m_manager, &QNetworkAccessManager::authenticationRequired, this,
            &BraskHttpClient::onAuthenticationRequired);
    connect(m_manager, &QNetworkAccessManager::sslErrors, this, &BraskHttpClient::onSslErrors);
}

BraskHttpClient::~BraskHttpClient()
{
    m_shuttingDown = true;
    // Complete every outstanding call before the manager (our child) takes the replies with it.
    m_manager->disconnect(this);
    const QHash<QNetworkReply*, Exchange> exchanges = std::exchange(m_exchanges, {});
    for (auto it = exchanges.begin(); it != exchanges.end(); ++it) {
        QNetworkReply* reply = it.key();
        reply->disconnect(this);
        reply->abort();
        reply->deleteLater();
        it->completion->call(QNetworkReply::OperationCanceledError, QByteArray(), QByteArray(), true);
    }
}

bool BraskHttpClient::Get(
    const QString& host, const QString& path, quint16 port, bool useSSL, const QString& user,
    const QString& password,
    std::function<void(QNetworkReply::NetworkError, const QByteArray&, const QByteArray&, bool)> completion,
    unsigned int timeoutMs, const QList<QString>& list)
{
    auto once = std::make_shared<CompletionOnce>(std::move(completion));
    const bool valid = !host.isEmpty() && port != 0 && !m_shuttingDown;
    Call call{host, path, port, useSSL, user, password, timeoutMs, list};
    // Always through the event loop: the caller never sees its completion run inside Get, and a
    // call from another thread reaches the manager's thread. If this client is destroyed first,
    // the discarded functor releases `once`, which completes the call as cancelled.
    QMetaObject::invokeMethod(
        this,
        [this, call, once, valid]() {
            if (!valid) {
                once->call(QNetworkReply::ProtocolInvalidOperationError, QByteArray(), QByteArray(), false);
                return;
            }
            start(call, once);
        },
        Qt::QueuedConnection);
    return valid;
}

void BraskHttpClient::start(const Call& call, const std::shared_ptr<CompletionOnce>& completion)
{
    if (m_shuttingDown) {
        completion->call(QNetworkReply::OperationCanceledError, QByteArray(), QByteArray(), true);
        return;
    }
    QUrl url;
    url.setScheme(call.useSSL ? QStringLiteral("https") : QStringLiteral("http"));
    url.setHost(call.host);
    url.setPort(call.port);
    // The caller's path arrives already encoded; tolerant mode keeps its %XX sequences as they are.
    const qsizetype question = call.path.indexOf(QLatin1Char('?'));
    url.setPath(question < 0 ? call.path : call.path.left(question), QUrl::TolerantMode);
    if (question >= 0) {
        url.setQuery(call.path.mid(question + 1), QUrl::TolerantMode);
    }
    if (!url.isValid()) {
        completion->call(QNetworkReply::ProtocolInvalidOperationError, QByteArray(), QByteArray(), false);
        return;
    }

    QNetworkRequest request(url);
    for (const QString& line : call.headers) {
        const qsizetype colon = line.indexOf(QLatin1Char(':'));
        if (colon > 0) {
            request.setRawHeader(line.left(colon).trimmed().toLatin1(),
                                 line.mid(colon + 1).trimmed().toLatin1());
        }
    }
    // Cameras keep few connections open; one per camera is enough since calls of one camera are
    // serialised by the caller.
    request.setAttribute(QNetworkRequest::Http2AllowedAttribute, false);

    QNetworkReply* reply = m_manager->get(request);
    Exchange exchange;
    exchange.completion = completion;
    exchange.user = call.user;
    exchange.password = call.password;
    exchange.host = call.host;
    if (call.timeoutMs > 0) {
        exchange.timer = new QTimer(this);
        exchange.timer->setSingleShot(true);
        connect(exchange.timer, &QTimer::timeout, reply, [this, reply]() {
            auto it = m_exchanges.find(reply);
            if (it != m_exchanges.end()) {
                it->timedOut = true;
                reply->abort(); // finishes the reply, which completes the call
            }
        });
        exchange.timer->start(int(qMin<unsigned int>(call.timeoutMs, unsigned(INT_MAX))));
    }
    m_exchanges.insert(reply, exchange);
    // The time limit counts silence, not the whole exchange: every byte that arrives starts it
    // again, so a long answer that keeps streaming is never cut off.
    connect(reply, &QNetworkReply::downloadProgress, this, [this, reply](qint64 received, qint64 total) {
        auto it = m_exchanges.find(reply);
        if (it == m_exchanges.end() || it->tooLarge || it->timedOut) {
            return;
        }
        if (m_options.maxBodyBytes > 0 && qMax(received, total) > m_options.maxBodyBytes) {
            it->tooLarge = true;
            reply->abort();
        } else if (it->timer) {
            it->timer->start();
        }
    });
}

void BraskHttpClient::onFinished(QNetworkReply* reply)
{
    reply->deleteLater();
    auto it = m_exchanges.find(reply);
    if (it == m_exchanges.end()) {
        return;
    }
    const Exchange exchange = it.value();
    m_exchanges.erase(it);
    if (exchange.timer) {
        // Later: we may be inside that timer's own time-out signal.
        exchange.timer->stop();
        exchange.timer->deleteLater();
    }

    QByteArray headers;
    for (const auto& pair : reply->rawHeaderPairs()) {
        headers += pair.first + ": " + pair.second + "\r\n";
    }
    QNetworkReply::NetworkError error = reply->error();
    QByteArray body;
    if (exchange.timedOut) {
        error = QNetworkReply::TimeoutError;
    } else if (exchange.tooLarge) {
        error = QNetworkReply::UnknownContentError;
    } else {
        body = reply->readAll();
    }
    exchange.completion->call(error, headers, body, exchange.timedOut || exchange.tooLarge);
}

void BraskHttpClient::onAuthenticationRequired(QNetworkReply* reply, QAuthenticator* authenticator)
{
    auto it = m_exchanges.find(reply);
    // Answer one challenge per exchange: a second one means the credentials were refused, and
    // leaving it unanswered ends the reply with AuthenticationRequiredError instead of looping.
    if (it == m_exchanges.end() || it->authAnswered || it->user.isEmpty()) {
        return;
    }
    it->authAnswered = true;
    authenticator->setUser(it->user);
    authenticator->setPassword(it->password);
}

void BraskHttpClient::onSslErrors(QNetworkReply* reply, const QList<QSslError>& errors)
{
    auto it = m_exchanges.find(reply);
    if (it == m_exchanges.end() || !m_options.acceptSelfSignedOnLocalNetwork ||
        !isLocalNetworkHost(it->host)) {
        return;
    }
    for (const QSslError& error : errors) {
        switch (error.error()) {
        case QSslError::SelfSignedCertificate:
        case QSslError::SelfSignedCertificateInChain:
        case QSslError::UnableToGetLocalIssuerCertificate:
        case QSslError::UnableToVerifyFirstCertificate:
        case QSslError::CertificateUntrusted:
        case QSslError::HostNameMismatch:
            break;
        default:
            return; // expired, revoked, malformed...: refused even on the local network
        }
    }
    reply->ignoreSslErrors(errors);
}

bool BraskHttpClient::isLocalNetworkHost(const QString& host)
{
    if (host.compare(QLatin1String("localhost"), Qt::CaseInsensitive) == 0) {
        return true;
    }
    QHostAddress address;
    if (!address.setAddress(host)) {
        return false;
    }
    if (address.isLoopback() || address.isLinkLocal()) {
        return true;
    }
    static const QPair<QHostAddress, int> privateRanges[] = {
        QHostAddress::parseSubnet(QStringLiteral("10.0.0.0/8")),
        QHostAddress::parseSubnet(QStringLiteral("172.16.0.0/12")),
        QHostAddress::parseSubnet(QStringLiteral("192.168.0.0/16")),
        QHostAddress::parseSubnet(QStringLiteral("fc00::/7")),
    };
    for (const auto& range : privateRanges) {
        if (address.isInSubnet(range)) {
            return true;
        }
    }
    return false;
}
