#include "JsonVariantParser.h"

#include <QString>
#include <QUtf8StringView>
#include <QVariantList>
#include <QVariantMap>

#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstring>

namespace {

// Deeper documents are left to QJsonDocument; the store's texts are three levels deep.
constexpr int kMaxDepth = 64;

class Reader
{
public:
    Reader(const char* text, std::size_t length)
        : m_p(text)
        , m_end(text + length)
    {}

    bool document(QVariant* out)
    {
        skipSpace();
        if (m_p == m_end || (*m_p != '{' && *m_p != '[')) {
            return false;
        }
        if (!value(out, 0)) {
            return false;
        }
        skipSpace();
        return m_p == m_end;
    }

private:
    void skipSpace()
    {
        while (m_p != m_end && (*m_p == ' ' || *m_p == '\n' || *m_p == '\r' || *m_p == '\t')) {
            ++m_p;
        }
    }

    bool literal(const char* word, std::size_t length)
    {
        if (static_cast<std::size_t>(m_end - m_p) < length || std::memcmp(m_p, word, length) != 0) {
            return false;
        }
        m_p += length;
        return true;
    }

    bool value(QVariant* out, int depth)
    {
        skipSpace();
        if (m_p == m_end) {
            return false;
        }
        switch (*m_p) {
        case '{':
            return object(out, depth + 1);
        case '[':
            return array(out, depth + 1);
        case '"': {
            QString text;
            if (!string(&text)) {
                return false;
            }
            *out = QVariant(std::move(text));
            return true;
        }
        case 't':
            *out = QVariant(true);
            return literal("true", 4);
        case 'f':
            *out = QVariant(false);
            return literal("false", 5);
        case 'n':
            *out = QVariant::fromValue(nullptr);
            return literal("null", 4);
        default:
            return number(out);
        }
    }

    bool object(QVariant* out, int depth)
    {
        if (depth > kMaxDepth) {
            return false;
        }
        ++m_p; // '{'
        QVariantMap map;
        skipSpace();
        if (m_p != m_end && *m_p == '}') {
            ++m_p;
            *out = QVariant(std::move(map));
            return true;
        }
        for (;;) {
            skipSpace();
            QString key;
            if (m_p == m_end || *m_p != '"' || !string(&key)) {
                return false;
            }
            skipSpace();
            if (m_p == m_end || *m_p != ':') {
                return false;
            }
            ++m_p;
            QVariant member;
            if (!value(&member, depth)) {
                return false;
            }
            // A repeated name keeps its last value, as QJsonDocument does.
            map.insert(key, member);
            skipSpace();
            if (m_p == m_end) {
                return false;
            }
            if (*m_p == ',') {
                ++m_p;
                continue;
            }
            if (*m_p == '}') {
                ++m_p;
                *out = QVariant(std::move(map));
                return true;
            }
            return false;
        }
    }

    bool array(QVariant* out, int depth)
    {
        if (depth > kMaxDepth) {
            return false;
        }
        ++m_p; // '['
        QVariantList list;
        skipSpace();
        if (m_p != m_end && *m_p == ']') {
            ++m_p;
            *out = QVariant(std::move(list));
            return true;
        }
        for (;;) {
            list.emplace_back();
            if (!value(&list.back(), depth)) {
                return false;
            }
            skipSpace();
            if (m_p == m_end) {
                return false;
            }
            if (*m_p == ',') {
                ++m_p;
                continue;
            }
            if (*m_p == ']') {
                ++m_p;
                *out = QVariant(std::move(list));
                return true;
            }
            return false;
        }
    }

    // Eight bytes at a time: is any of them a quote, a backslash, a control character or
    // not ASCII? Thumbnail texts are long runs of base64 with none of these.
    static bool wordHasSpecial(uint64_t word)
    {
        constexpr uint64_t ones = 0x0101010101010101ull;
        constexpr uint64_t highs = 0x8080808080808080ull;
        const auto hasZero = [](uint64_t x) { return (x - ones) & ~x & highs; };
        const uint64_t nonAscii = word & highs;
        const uint64_t control = (word - ones * 0x20) & ~word & highs;
        return (nonAscii | control | hasZero(word ^ (ones * '"')) | hasZero(word ^ (ones * '\\'))) != 0;
    }

    static bool isSpecial(unsigned char c) { return c == '"' || c == '\\' || c < 0x20 || c >= 0x80; }

    bool string(QString* out)
    {
        ++m_p; // opening quote
        const char* start = m_p;
        while (m_end - m_p >= 8) {
            uint64_t word;
            std::memcpy(&word, m_p, sizeof word);
            if (wordHasSpecial(word)) {
                break;
            }
            m_p += 8;
        }
        while (m_p != m_end && !isSpecial(static_cast<unsigned char>(*m_p))) {
            ++m_p;
        }
        if (m_p == m_end) {
            return false;
        }
        if (*m_p == '"') {
            *out = QString::fromLatin1(start, m_p - start);
            ++m_p;
            return true;
        }
        // Escapes or non-ASCII text: the careful way, from the start of the string.
        m_p = start;
        return slowString(out);
    }

    static int hexDigit(char c)
    {
        if (c >= '0' && c <= '9') {
            return c - '0';
        }
        if (c >= 'a' && c <= 'f') {
            return c - 'a' + 10;
        }
        if (c >= 'A' && c <= 'F') {
            return c - 'A' + 10;
        }
        return -1;
    }

    bool slowString(QString* out)
    {
        QString text;
        for (;;) {
            const char* run = m_p;
            while (m_p != m_end && *m_p != '"' && *m_p != '\\') {
                if (static_cast<unsigned char>(*m_p) < 0x20) {
                    return false; // raw control characters: QJsonDocument decides
                }
                ++m_p;
            }
            if (m_p == m_end) {
                return false;
            }
            if (m_p != run) {
                const QUtf8StringView bytes(run, m_p - run);
                if (!bytes.isValidUtf8()) {
                    return false;
                }
                text.append(QString::fromUtf8(run, m_p - run));
            }
            if (*m_p == '"') {
                ++m_p;
                *out = std::move(text);
                return true;
            }
            ++m_p; // backslash
            if (m_p == m_end) {
                return false;
            }
            const char escape = *m_p++;
            switch (escape) {
            case '"':
            case '\\':
            case '/':
                text.append(QLatin1Char(escape));
                break;
            case 'b':
                text.append(QLatin1Char('\b'));
                break;
            case 'f':
                text.append(QLatin1Char('\f'));
                break;
            case 'n':
                text.append(QLatin1Char('\n'));
                break;
            case 'r':
                text.append(QLatin1Char('\r'));
                break;
            case 't':
                text.append(QLatin1Char('\t'));
                break;
            case 'u': {
                if (m_end - m_p < 4) {
                    return false;
                }
                char16_t unit = 0;
                for (int i = 0; i < 4; ++i) {
                    const int digit = hexDigit(m_p[i]);
                    if (digit < 0) {
                        return false;
                    }
                    unit = static_cast<char16_t>((unit << 4) | digit);
                }
                m_p += 4;
                // Surrogates are kept unit by unit, paired or not, as QJsonDocument keeps them.
                text.append(QChar(unit));
                break;
            }
            default:
                return false;
            }
        }
    }

    static bool isDigit(char c) { return c >= '0' && c <= '9'; }

    bool number(QVariant* out)
    {
        const char* start = m_p;
        bool integral = true;
        if (m_p != m_end && *m_p == '-') {
            ++m_p;
        }
        if (m_p == m_end || !isDigit(*m_p)) {
            return false;
        }
        if (*m_p == '0') {
            ++m_p;
        } else {
            while (m_p != m_end && isDigit(*m_p)) {
                ++m_p;
            }
        }
        if (m_p != m_end && *m_p == '.') {
            integral = false;
            ++m_p;
            if (m_p == m_end || !isDigit(*m_p)) {
                return false;
            }
            while (m_p != m_end && isDigit(*m_p)) {
                ++m_p;
            }
        }
        if (m_p != m_end && (*m_p == 'e' || *m_p == 'E')) {
            integral = false;
            ++m_p;
            if (m_p != m_end && (*m_p == '+' || *m_p == '-')) {
                ++m_p;
            }
            if (m_p == m_end || !isDigit(*m_p)) {
                return false;
            }
            while (m_p != m_end && isDigit(*m_p)) {
                ++m_p;
            }
        }
        if (integral) {
            long long whole = 0;
            const auto [end, error] = std::from_chars(start, m_p, whole);
            if (error == std::errc() && end == m_p) {
                *out = QVariant(static_cast<qlonglong>(whole));
                return true;
            }
        }
        double real = 0;
        const auto [end, error] = std::from_chars(start, m_p, real);
        // Out of range, or so small that it loses precision: QJsonDocument decides.
        if (error != std::errc() || end != m_p || (real != 0 && !std::isnormal(real))) {
            return false;
        }
        // QJsonDocument keeps a number that has an exact 64-bit integer value as an integer.
        constexpr double twoTo63 = 9223372036854775808.0;
        if (real >= -twoTo63 && real < twoTo63 && real == std::trunc(real)) {
            *out = QVariant(static_cast<qlonglong>(real));
        } else {
            *out = QVariant(real);
        }
        return true;
    }

    const char* m_p;
    const char* m_end;
};

} // namespace

QVariant JsonVariantParser::parse(const char* text, std::size_t length, bool* ok)
{
    QVariant result;
    const bool parsed = text && Reader(text, length).document(&result);
    if (ok) {
        *ok = parsed;
    }
    return parsed ? result : QVariant();
}
