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
        default: {
            Number parsed;
            if (!number(&parsed)) {
                return false;
            }
            *out = parsed.integer ? QVariant(parsed.whole) : QVariant(parsed.real);
            return true;
        }
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
            skipSpace();
            if (m_p != m_end && (*m_p == '-' || isDigit(*m_p))) {
                // Feature vectors: numbers straight into the list, without a temporary.
                Number parsed;
                if (!number(&parsed)) {
                    return false;
                }
                if (parsed.integer) {
                    list.emplaceBack(parsed.whole);
                } else {
                    list.emplaceBack(parsed.real);
                }
            } else {
                list.emplace_back();
                if (!value(&list.back(), depth)) {
                    return false;
                }
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

    // Eight bytes at a time: thumbnail texts are long runs of base64.
    static bool isAscii(const char* p, const char* end)
    {
        uint64_t bits = 0;
        while (end - p >= 8) {
            uint64_t word;
            std::memcpy(&word, p, sizeof word);
            bits |= word;
            p += 8;
        }
        while (p != end) {
            bits |= static_cast<unsigned char>(*p++);
        }
        return (bits & 0x8080808080808080ull) == 0;
    }

    bool string(QString* out)
    {
        ++m_p; // opening quote
        const char* start = m_p;
        const auto* quote = static_cast<const char*>(std::memchr(m_p, '"', std::size_t(m_end - m_p)));
        if (!quote) {
            return false;
        }
        // Without escapes and in ASCII the text is the bytes as they stand (raw control
        // characters included, which QJsonDocument takes as they are too).
        if (!std::memchr(start, '\\', std::size_t(quote - start)) && isAscii(start, quote)) {
            *out = QString::fromLatin1(start, quote - start);
            m_p = quote + 1;
            return true;
        }
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

    // Exact powers of ten: a mantissa of at most 53 bits scaled by one of them is rounded once,
    // so the result is the correctly rounded value that every conforming parser gives.
    static double exactPowerOfTen(int exponent)
    {
        static const double powers[] = {1e0,  1e1,  1e2,  1e3,  1e4,  1e5,  1e6,  1e7,
                                        1e8,  1e9,  1e10, 1e11, 1e12, 1e13, 1e14, 1e15,
                                        1e16, 1e17, 1e18, 1e19, 1e20, 1e21, 1e22};
        return powers[exponent];
    }

    // Eight ASCII digits at once (little-endian load): feature vectors are long runs of
    // numbers with many digits each.
    static bool eightDigits(const char* p, uint64_t* value)
    {
        if constexpr (Q_BYTE_ORDER != Q_LITTLE_ENDIAN) {
            return false;
        }
        uint64_t word;
        std::memcpy(&word, p, sizeof word);
        if ((((word & 0xF0F0F0F0F0F0F0F0ull) |
              (((word + 0x0606060606060606ull) & 0xF0F0F0F0F0F0F0F0ull) >> 4)) != 0x3333333333333333ull)) {
            return false;
        }
        word -= 0x3030303030303030ull;
        word = (word * 10) + (word >> 8);
        constexpr uint64_t mask = 0x000000FF000000FFull;
        constexpr uint64_t mul1 = 0x000F424000000064ull; // 100 + (1000000 << 32)
        constexpr uint64_t mul2 = 0x0000271000000001ull; // 1 + (10000 << 32)
        *value = (((word & mask) * mul1) + (((word >> 16) & mask) * mul2)) >> 32;
        return true;
    }

    // Appends the digits at m_p to mantissa (which wraps beyond 19 digits; the caller then
    // does not use it) and returns how many there were.
    int digitRun(uint64_t* mantissa)
    {
        const char* first = m_p;
        uint64_t eight = 0;
        while (m_end - m_p >= 8 && eightDigits(m_p, &eight)) {
            *mantissa = *mantissa * 100000000ull + eight;
            m_p += 8;
        }
        while (m_p != m_end && isDigit(*m_p)) {
            *mantissa = *mantissa * 10 + uint64_t(*m_p++ - '0');
        }
        return int(m_p - first);
    }

    struct Number
    {
        bool integer = false;
        qlonglong whole = 0;
        double real = 0;
    };

    bool number(Number* out)
    {
        const char* start = m_p;
        bool negative = false;
        if (m_p != m_end && *m_p == '-') {
            negative = true;
            ++m_p;
        }
        if (m_p == m_end || !isDigit(*m_p)) {
            return false;
        }
        // Every digit goes into a 64-bit mantissa; with more than 19 digits it may have
        // wrapped, and the general conversion takes over.
        uint64_t mantissa = 0;
        int digits = 0;
        int exponent = 0;
        bool integral = true;
        if (*m_p == '0') {
            ++m_p;
            digits = 1;
        } else {
            digits = digitRun(&mantissa);
        }
        if (m_p != m_end && *m_p == '.') {
            integral = false;
            ++m_p;
            const int fraction = digitRun(&mantissa);
            if (fraction == 0) {
                return false;
            }
            digits += fraction;
            exponent = -fraction;
        }
        if (m_p != m_end && (*m_p == 'e' || *m_p == 'E')) {
            integral = false;
            ++m_p;
            bool negativeExponent = false;
            if (m_p != m_end && (*m_p == '+' || *m_p == '-')) {
                negativeExponent = *m_p == '-';
                ++m_p;
            }
            if (m_p == m_end || !isDigit(*m_p)) {
                return false;
            }
            int written = 0;
            while (m_p != m_end && isDigit(*m_p)) {
                written = written < 100000 ? written * 10 + (*m_p - '0') : written;
                ++m_p;
            }
            exponent += negativeExponent ? -written : written;
        }

        if (integral && digits <= 18) {
            out->integer = true;
            out->whole = negative ? -qlonglong(mantissa) : qlonglong(mantissa);
            return true;
        }
        double real = 0;
        if (digits <= 19 && mantissa <= (uint64_t(1) << 53) && exponent >= -22 && exponent <= 22) {
            real = double(mantissa);
            real = exponent < 0 ? real / exactPowerOfTen(-exponent) : real * exactPowerOfTen(exponent);
            real = negative ? -real : real;
        } else {
            if (integral) {
                long long whole = 0;
                const auto [end, error] = std::from_chars(start, m_p, whole);
                if (error == std::errc() && end == m_p) {
                    out->integer = true;
                    out->whole = whole;
                    return true;
                }
            }
            const auto [end, error] = std::from_chars(start, m_p, real);
            // Out of range, or so small that it loses precision: QJsonDocument decides.
            if (error != std::errc() || end != m_p || (real != 0 && !std::isnormal(real))) {
                return false;
            }
        }
        // QJsonDocument keeps a number that has an exact 64-bit integer value as an integer.
        constexpr double twoTo63 = 9223372036854775808.0;
        if (real >= -twoTo63 && real < twoTo63) {
            const qlonglong whole = static_cast<qlonglong>(real);
            if (static_cast<double>(whole) == real) {
                out->integer = true;
                out->whole = whole;
                return true;
            }
        }
        out->integer = false;
        out->real = real;
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
