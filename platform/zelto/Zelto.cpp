#include "Zelto.h"

#include <QByteArray>
#include <QCryptographicHash>
#include <QDateTime>
#include <QMessageAuthenticationCode>
#include <QRandomGenerator>
#include <QtEndian>

namespace Zelto {
namespace {

constexpr int kStepBytes = 8;
constexpr int kNonceBytes = 8;
constexpr int kMacBytes = 16;

QByteArray urlSafe(const QByteArray& raw)
{
    return raw.toBase64(QByteArray::Base64UrlEncoding | QByteArray::OmitTrailingEquals);
}

class ProtectedAPIMgr : public IProtectedAPIMgr
{
public:
    explicit ProtectedAPIMgr(ManagerOptions options)
        : m_options(std::move(options))
    {
        if (m_options.stepSeconds <= 0) {
            m_options.stepSeconds = 30;
        }
        if (m_options.toleranceSteps < 0) {
            m_options.toleranceSteps = 0;
        }
    }

    bool SetPairToken(const char* data, size_t length, bool replace) override
    {
        if (!replace && !m_pairToken.isEmpty()) {
            return true;
        }
        m_pairToken = (data && length > 0) ? QByteArray(data, qsizetype(length)) : QByteArray();
        return !m_pairToken.isEmpty();
    }

    bool VerifyAccessToken(const std::string& accessToken) const override
    {
        if (m_pairToken.isEmpty()) {
            return false;
        }
        const QByteArray text = QByteArray::fromStdString(accessToken);
        const QByteArray raw = QByteArray::fromBase64(text, QByteArray::Base64UrlEncoding);
        // Only the one spelling of the bytes is the token: the decoder ignores the last
        // character's spare bits and stray characters, so other texts would decode the same.
        if (raw.size() != kStepBytes + kNonceBytes + kMacBytes || urlSafe(raw) != text) {
            return false;
        }
        const qint64 step = qFromBigEndian<qint64>(raw.constData());
        const qint64 present = currentStep();
        if (step < present - m_options.toleranceSteps || step > present + m_options.toleranceSteps) {
            return false;
        }
        const QByteArray expected = mac(raw.left(kStepBytes + kNonceBytes));
        // Compare without an early exit so the time taken says nothing about the token.
        const QByteArray given = raw.mid(kStepBytes + kNonceBytes);
        unsigned char difference = 0;
        for (int i = 0; i < kMacBytes; ++i) {
            difference |= static_cast<unsigned char>(given[i] ^ expected[i]);
        }
        return difference == 0;
    }

    std::string GetAccessToken() override
    {
        if (m_pairToken.isEmpty()) {
            return std::string();
        }
        QByteArray sealed(kStepBytes + kNonceBytes, Qt::Uninitialized);
        qToBigEndian<qint64>(currentStep(), sealed.data());
        const quint64 nonce = QRandomGenerator::system()->generate64();
        memcpy(sealed.data() + kStepBytes, &nonce, kNonceBytes);
        return urlSafe(sealed + mac(sealed)).toStdString();
    }

private:
    qint64 currentStep() const
    {
        const qint64 now = m_options.clock ? m_options.clock() : QDateTime::currentSecsSinceEpoch();
        // Floor division, so times before 1970 still fall into whole steps.
        qint64 step = now / m_options.stepSeconds;
        if (now % m_options.stepSeconds < 0) {
            --step;
        }
        return step;
    }

    QByteArray mac(const QByteArray& message) const
    {
        const QByteArray key = QCryptographicHash::hash(
            QByteArray::fromStdString(m_options.secret) + '\0' + m_pairToken, QCryptographicHash::Sha256);
        return QMessageAuthenticationCode::hash(message, key, QCryptographicHash::Sha256).left(kMacBytes);
    }

    ManagerOptions m_options;
    QByteArray m_pairToken;
};

} // namespace

std::unique_ptr<IProtectedAPIMgr> CreateProtectedAPIManager(const char* data, size_t length, bool flag)
{
    ManagerOptions options;
    if (data && length > 0) {
        options.secret.assign(data, length);
    }
    options.toleranceSteps = flag ? 1 : 0;
    return CreateProtectedAPIManager(options);
}

std::unique_ptr<IProtectedAPIMgr> CreateProtectedAPIManager(const ManagerOptions& options)
{
    return std::make_unique<ProtectedAPIMgr>(options);
}

std::string GeneratePairToken()
{
    QByteArray raw(24, Qt::Uninitialized);
    QRandomGenerator::system()->fillRange(reinterpret_cast<quint32*>(raw.data()), raw.size() / 4);
    return urlSafe(raw).toStdString();
}

} // namespace Zelto
