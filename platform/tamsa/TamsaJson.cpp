#include "TamsaJson.h"

#include <charconv>
#include <cmath>
#include <cstring>

namespace tamsa {

namespace {

// Deeper texts are refused: recursion must stay bounded whatever a camera or client sends.
constexpr int kMaxDepth = 64;

constexpr double kExactPow10[] = {1e0,  1e1,  1e2,  1e3,  1e4,  1e5,  1e6,  1e7,  1e8,  1e9,  1e10, 1e11,
                                  1e12, 1e13, 1e14, 1e15, 1e16, 1e17, 1e18, 1e19, 1e20, 1e21, 1e22};

class Parser
{
public:
    Parser(const char* begin, const char* end)
        : m_p(begin)
        , m_end(end)
    {}

    bool parseDocument(JsonValue* out)
    {
        skipSpace();
        if (!parseValue(out, 0)) {
            return false;
        }
        skipSpace();
        return m_p == m_end;
    }

private:
    void skipSpace()
    {
        while (m_p < m_end && (*m_p == ' ' || *m_p == '\n' || *m_p == '\r' || *m_p == '\t')) {
            ++m_p;
        }
    }

    bool literal(const char* word, size_t length)
    {
        if (size_t(m_end - m_p) < length || std::memcmp(m_p, word, length) != 0) {
            return false;
        }
        m_p += length;
        return true;
    }

    bool parseValue(JsonValue* out, int depth)
    {
        if (m_p >= m_end) {
            return false;
        }
        switch (*m_p) {
        case '{':
            return parseObject(out, depth + 1);
        case '[':
            return parseArray(out, depth + 1);
        case '"':
            out->type = JsonValue::Type::String;
            return parseString(&out->text);
        case 't':
            out->type = JsonValue::Type::Bool;
            out->boolean = true;
            return literal("true", 4);
        case 'f':
            out->type = JsonValue::Type::Bool;
            out->boolean = false;
            return literal("false", 5);
        case 'n':
            out->type = JsonValue::Type::Null;
            return literal("null", 4);
        default: {
            const char* start = m_p;
            const char* next = parseNumber(m_p, m_end, &out->number);
            if (!next) {
                return false;
            }
            out->type = JsonValue::Type::Number;
            out->text.assign(start, next);
            m_p = next;
            return true;
        }
        }
    }

    bool parseObject(JsonValue* out, int depth)
    {
        if (depth > kMaxDepth) {
            return false;
        }
        out->type = JsonValue::Type::Object;
        ++m_p;
        skipSpace();
        if (m_p < m_end && *m_p == '}') {
            ++m_p;
            return true;
        }
        for (;;) {
            skipSpace();
            if (m_p >= m_end || *m_p != '"') {
                return false;
            }
            out->keys.emplace_back();
            if (!parseString(&out->keys.back())) {
                return false;
            }
            skipSpace();
            if (m_p >= m_end || *m_p != ':') {
                return false;
            }
            ++m_p;
            skipSpace();
            out->values.emplace_back();
            if (!parseValue(&out->values.back(), depth)) {
                return false;
            }
            skipSpace();
            if (m_p >= m_end) {
                return false;
            }
            if (*m_p == ',') {
                ++m_p;
                continue;
            }
            if (*m_p == '}') {
                ++m_p;
                return true;
            }
            return false;
        }
    }

    bool parseArray(JsonValue* out, int depth)
    {
        if (depth > kMaxDepth) {
            return false;
        }
        out->type = JsonValue::Type::Array;
        out->numberArray = true;
        ++m_p;
        skipSpace();
        if (m_p < m_end && *m_p == ']') {
            ++m_p;
            return true;
        }
        for (;;) {
            skipSpace();
            if (m_p >= m_end) {
                return false;
            }
            const char c = *m_p;
            if (out->numberArray && (c == '-' || (c >= '0' && c <= '9'))) {
                double value = 0;
                const char* next = parseNumber(m_p, m_end, &value);
                if (!next) {
                    return false;
                }
                out->numbers.push_back(value);
                m_p = next;
            } else {
                if (out->numberArray) {
                    // The first element that is not a number: fall back to a general array.
                    out->numberArray = false;
                    out->items.reserve(out->numbers.size() + 1);
                    for (double number : out->numbers) {
                        out->items.push_back(JsonValue::makeNumber(number));
                    }
                    out->numbers.clear();
                    out->numbers.shrink_to_fit();
                }
                out->items.emplace_back();
                if (!parseValue(&out->items.back(), depth)) {
                    return false;
                }
            }
            skipSpace();
            if (m_p >= m_end) {
                return false;
            }
            if (*m_p == ',') {
                ++m_p;
                continue;
            }
            if (*m_p == ']') {
                ++m_p;
                return true;
            }
            return false;
        }
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

    bool parseHex4(unsigned* out)
    {
        if (m_end - m_p < 4) {
            return false;
        }
        unsigned value = 0;
        for (int i = 0; i < 4; ++i) {
            const int digit = hexDigit(m_p[i]);
            if (digit < 0) {
                return false;
            }
            value = value * 16 + unsigned(digit);
        }
        m_p += 4;
        *out = value;
        return true;
    }

    static void appendUtf8(std::string* out, unsigned code)
    {
        if (code < 0x80) {
            out->push_back(char(code));
        } else if (code < 0x800) {
            out->push_back(char(0xC0 | (code >> 6)));
            out->push_back(char(0x80 | (code & 0x3F)));
        } else if (code < 0x10000) {
            out->push_back(char(0xE0 | (code >> 12)));
            out->push_back(char(0x80 | ((code >> 6) & 0x3F)));
            out->push_back(char(0x80 | (code & 0x3F)));
        } else {
            out->push_back(char(0xF0 | (code >> 18)));
            out->push_back(char(0x80 | ((code >> 12) & 0x3F)));
            out->push_back(char(0x80 | ((code >> 6) & 0x3F)));
            out->push_back(char(0x80 | (code & 0x3F)));
        }
    }

    // Length of the well-formed UTF-8 sequence at p (no overlong forms, no surrogates, nothing
    // above U+10FFFF), or 0. The texts the store hands out are read by strict JSON readers that
    // refuse a whole text over one bad byte, so the store must not take such bytes in.
    static size_t utf8Length(const unsigned char* p, const unsigned char* end)
    {
        const unsigned char c = p[0];
        size_t length = 0;
        unsigned char low = 0x80;
        unsigned char high = 0xBF;
        if (c >= 0xC2 && c <= 0xDF) {
            length = 2;
        } else if (c >= 0xE0 && c <= 0xEF) {
            length = 3;
            low = c == 0xE0 ? 0xA0 : 0x80;
            high = c == 0xED ? 0x9F : 0xBF;
        } else if (c >= 0xF0 && c <= 0xF4) {
            length = 4;
            low = c == 0xF0 ? 0x90 : 0x80;
            high = c == 0xF4 ? 0x8F : 0xBF;
        } else {
            return 0;
        }
        if (size_t(end - p) < length || p[1] < low || p[1] > high) {
            return 0;
        }
        for (size_t i = 2; i < length; ++i) {
            if (p[i] < 0x80 || p[i] > 0xBF) {
                return 0;
            }
        }
        return length;
    }

    // Whether any of the eight bytes needs a look of its own: a quote, a backslash, a control
    // character or a byte of a multi-byte UTF-8 sequence. Exact for the "any" question.
    static bool hasSpecialByte(uint64_t v)
    {
        constexpr uint64_t ones = 0x0101010101010101ULL;
        constexpr uint64_t highs = 0x8080808080808080ULL;
        const uint64_t quote = v ^ (ones * '"');
        const uint64_t backslash = v ^ (ones * '\\');
        const uint64_t zeroQuote = (quote - ones) & ~quote;
        const uint64_t zeroBackslash = (backslash - ones) & ~backslash;
        const uint64_t control = (v - ones * 0x20) & ~v;
        return ((zeroQuote | zeroBackslash | control) & highs) != 0 || (v & highs) != 0;
    }

    bool parseString(std::string* out)
    {
        ++m_p; // opening quote
        const char* runStart = m_p;
        for (;;) {
            // Thumbnails are long base64 runs: eight plain bytes are passed at a time.
            while (m_end - m_p >= 8) {
                uint64_t v;
                std::memcpy(&v, m_p, sizeof v);
                if (hasSpecialByte(v)) {
                    break;
                }
                m_p += 8;
            }
            if (m_p >= m_end) {
                return false;
            }
            const unsigned char c = static_cast<unsigned char>(*m_p);
            if (c == '"') {
                out->append(runStart, m_p);
                ++m_p;
                return true;
            }
            if (c < 0x20) {
                return false;
            }
            if (c >= 0x80) {
                const size_t length = utf8Length(reinterpret_cast<const unsigned char*>(m_p),
                                                 reinterpret_cast<const unsigned char*>(m_end));
                if (length == 0) {
                    return false;
                }
                m_p += length;
                continue;
            }
            if (c != '\\') {
                ++m_p;
                continue;
            }
            out->append(runStart, m_p);
            ++m_p;
            if (m_p >= m_end) {
                return false;
            }
            const char escape = *m_p++;
            switch (escape) {
            case '"':
            case '\\':
            case '/':
                out->push_back(escape);
                break;
            case 'b':
                out->push_back('\b');
                break;
            case 'f':
                out->push_back('\f');
                break;
            case 'n':
                out->push_back('\n');
                break;
            case 'r':
                out->push_back('\r');
                break;
            case 't':
                out->push_back('\t');
                break;
            case 'u': {
                unsigned code = 0;
                if (!parseHex4(&code)) {
                    return false;
                }
                if (code >= 0xD800 && code < 0xDC00 && m_end - m_p >= 6 && m_p[0] == '\\' && m_p[1] == 'u') {
                    const char* save = m_p;
                    m_p += 2;
                    unsigned low = 0;
                    if (parseHex4(&low) && low >= 0xDC00 && low < 0xE000) {
                        code = 0x10000 + ((code - 0xD800) << 10) + (low - 0xDC00);
                    } else {
                        m_p = save;
                        code = 0xFFFD;
                    }
                } else if (code >= 0xD800 && code < 0xE000) {
                    code = 0xFFFD; // a lone surrogate has no UTF-8 form
                }
                appendUtf8(out, code);
                break;
            }
            default:
                return false;
            }
            runStart = m_p;
        }
    }

    const char* m_p;
    const char* m_end;
};

void appendEscaped(std::string* out, const std::string& text)
{
    out->push_back('"');
    size_t runStart = 0;
    for (size_t i = 0; i < text.size(); ++i) {
        const unsigned char c = static_cast<unsigned char>(text[i]);
        if (c >= 0x20 && c != '"' && c != '\\') {
            continue;
        }
        out->append(text, runStart, i - runStart);
        runStart = i + 1;
        switch (c) {
        case '"':
            out->append("\\\"");
            break;
        case '\\':
            out->append("\\\\");
            break;
        case '\n':
            out->append("\\n");
            break;
        case '\r':
            out->append("\\r");
            break;
        case '\t':
            out->append("\\t");
            break;
        default: {
            static const char hex[] = "0123456789abcdef";
            const char escaped[] = {'\\', 'u', '0', '0', hex[c >> 4], hex[c & 15]};
            out->append(escaped, sizeof escaped);
        }
        }
    }
    out->append(text, runStart, std::string::npos);
    out->push_back('"');
}

void appendDouble(std::string* out, double value)
{
    if (!std::isfinite(value)) {
        out->append("null"); // JSON has no infinities; ingest refuses them, this is a last resort
        return;
    }
    char buffer[40];
    if (value == std::floor(value) && std::fabs(value) < 1e15) {
        const auto result = std::to_chars(buffer, buffer + sizeof buffer, static_cast<long long>(value));
        out->append(buffer, result.ptr);
        return;
    }
    const auto result = std::to_chars(buffer, buffer + sizeof buffer, value);
    out->append(buffer, result.ptr);
}

} // namespace

const char* parseNumber(const char* begin, const char* end, double* value)
{
    const char* p = begin;
    bool negative = false;
    if (p < end && *p == '-') {
        negative = true;
        ++p;
    }
    if (p >= end || *p < '0' || *p > '9') {
        return nullptr;
    }
    uint64_t mantissa = 0;
    int significant = 0;
    int exponent = 0;
    bool exact = true;
    auto takeDigit = [&](char c, bool fraction) {
        if (mantissa == 0 && c == '0') {
            if (fraction) {
                --exponent;
            }
            return;
        }
        if (significant < 19) {
            mantissa = mantissa * 10 + uint64_t(c - '0');
            ++significant;
            if (fraction) {
                --exponent;
            }
        } else {
            exact = false; // more digits than fit: the slow path rounds correctly
            if (!fraction) {
                ++exponent;
            }
        }
    };
    if (*p == '0') {
        ++p; // JSON forbids leading zeros: "01" ends the number after the 0
    } else {
        while (p < end && *p >= '0' && *p <= '9') {
            takeDigit(*p++, false);
        }
    }
    if (p < end && *p == '.') {
        ++p;
        if (p >= end || *p < '0' || *p > '9') {
            return nullptr;
        }
        while (p < end && *p >= '0' && *p <= '9') {
            takeDigit(*p++, true);
        }
    }
    if (p < end && (*p == 'e' || *p == 'E')) {
        ++p;
        bool expNegative = false;
        if (p < end && (*p == '+' || *p == '-')) {
            expNegative = *p == '-';
            ++p;
        }
        if (p >= end || *p < '0' || *p > '9') {
            return nullptr;
        }
        int written = 0;
        while (p < end && *p >= '0' && *p <= '9') {
            if (written < 100000) {
                written = written * 10 + (*p - '0');
            }
            ++p;
        }
        exponent += expNegative ? -written : written;
    }
    if (exact && mantissa < (uint64_t(1) << 53) && exponent >= -22 && exponent <= 22) {
        // Both the mantissa and the power of ten are exact doubles: one rounding, exact result.
        double result = double(mantissa);
        result = exponent < 0 ? result / kExactPow10[-exponent] : result * kExactPow10[exponent];
        *value = negative ? -result : result;
        return p;
    }
    if (mantissa == 0 && exact) {
        *value = negative ? -0.0 : 0.0;
        return p;
    }
    double result = 0;
    const auto parsed = std::from_chars(begin, p, result);
    if (parsed.ec == std::errc::result_out_of_range) {
        // Overflow becomes an infinity (callers refuse it), underflow zero.
        // The value is about 10^(exponent + significant - 1): above 1 it overflowed.
        result = exponent + significant > 0 ? HUGE_VAL : 0.0;
        if (negative) {
            result = -result;
        }
    } else if (parsed.ec != std::errc() || parsed.ptr != p) {
        return nullptr;
    }
    *value = result;
    return p;
}

namespace {

const char kDigitPairs[201] =
    "00010203040506070809101112131415161718192021222324252627282930313233343536373839"
    "40414243444546474849505152535455565758596061626364656667686970717273747576777879"
    "8081828384858687888990919293949596979899";

struct Powers
{
    double values[101]; // 10^-50 .. 10^50
    Powers()
    {
        for (int i = 0; i < 101; ++i) {
            values[i] = std::pow(10.0, i - 50);
        }
    }
};
const Powers g_powers;

} // namespace

int formatFloat(float value, char* out)
{
    // Runs for every number of every vector a search hands out, so it avoids loops over digits
    // and divisions: nine significant digits (always enough to read back the same float),
    // written two at a time, trailing zeros dropped.
    char* p = out;
    if (!(value != 0) || !std::isfinite(value)) {
        *p++ = '0';
        return int(p - out);
    }
    // Signs are random in feature vectors: no branch on them.
    *p = '-';
    p += value < 0 ? 1 : 0;
    value = std::fabs(value);
    const double* pow10 = g_powers.values + 50;
    uint32_t bits = 0;
    std::memcpy(&bits, &value, sizeof bits);
    if ((bits >> 23) == 0) {
        // subnormal: rare enough for the exact library routine
        return int(std::to_chars(p, p + 24, value).ptr - out);
    }
    // Decimal exponent k with 10^k <= d < 10^(k+1): floor(e2 * log10(2)) is off by at most one.
    int k = ((int((bits >> 23) & 0xFF) - 127) * 1233) >> 12;
    const double d = value;
    k += d >= pow10[k + 1] ? 1 : 0;
    k -= d < pow10[k] ? 1 : 0;
    uint32_t digits = uint32_t(d * pow10[8 - k] + 0.5);
    if (digits >= 1000000000u) {
        digits = 100000000u;
        ++k;
    }
    // The nine digits are assembled in a register: writing them byte by byte and reading them
    // back as one word would stall on store forwarding.
    const uint32_t high = digits / 10000000u; // the first two digits
    const uint32_t low = digits % 10000000u;
    auto pair = [](uint32_t value) {
        uint16_t bytes = 0;
        std::memcpy(&bytes, kDigitPairs + 2 * value, 2);
        return uint64_t(bytes);
    };
    const uint64_t word = pair(high) | pair(low / 100000u) << 16 | pair((low / 1000u) % 100u) << 32 |
                          pair((low / 10u) % 100u) << 48;
    const char last = char('0' + low % 10u);
    int count = 9;
    for (uint32_t rest = digits; count > 1 && rest % 10 == 0; rest /= 10) {
        --count;
    }
    if (k < 0 && k >= -5) {
        // Feature values live here: fixed-size copies, then the pointer moves by the real length.
        std::memcpy(p, "0.000000", 8);
        p += 1 - k;
        std::memcpy(p, &word, 8);
        p[8] = last;
        return int(p + count - out);
    }
    char text[16];
    std::memcpy(text, &word, 8);
    text[8] = last;
    if (k >= 0 && k < 9) {
        const int integerDigits = k + 1;
        for (int i = 0; i < integerDigits; ++i) {
            *p++ = i < count ? text[i] : '0';
        }
        if (count > integerDigits) {
            *p++ = '.';
            std::memcpy(p, text + integerDigits, size_t(count - integerDigits));
            p += count - integerDigits;
        }
        return int(p - out);
    }
    *p++ = text[0];
    if (count > 1) {
        *p++ = '.';
        std::memcpy(p, text + 1, size_t(count - 1));
        p += count - 1;
    }
    *p++ = 'e';
    if (k < 0) {
        *p++ = '-';
        k = -k;
    }
    if (k >= 10) {
        *p++ = char('0' + k / 10);
    }
    *p++ = char('0' + k % 10);
    return int(p - out);
}

void appendFloatArray(std::string* out, const float* values, size_t count)
{
    // Written straight into the text: at most 24 characters and a comma per number.
    const size_t start = out->size();
    out->resize(start + count * 25 + 2);
    char* p = &(*out)[start];
    *p++ = '[';
    for (size_t i = 0; i < count; ++i) {
        *p = ',';
        p += i ? 1 : 0;
        p += formatFloat(values[i], p);
    }
    *p++ = ']';
    out->resize(size_t(p - out->data()));
}

JsonValue JsonValue::arrayElement(size_t i) const
{
    if (numberArray) {
        return i < numbers.size() ? makeNumber(numbers[i]) : JsonValue();
    }
    return i < items.size() ? items[i] : JsonValue();
}

const JsonValue* JsonValue::member(std::string_view key) const
{
    for (size_t i = 0; i < keys.size(); ++i) {
        if (keys[i] == key) {
            return &values[i];
        }
    }
    return nullptr;
}

JsonValue* JsonValue::member(std::string_view key)
{
    return const_cast<JsonValue*>(static_cast<const JsonValue*>(this)->member(key));
}

void JsonValue::setMember(std::string_view key, JsonValue value)
{
    if (JsonValue* existing = member(key)) {
        *existing = std::move(value);
        return;
    }
    type = Type::Object;
    keys.emplace_back(key);
    values.push_back(std::move(value));
}

JsonValue JsonValue::makeString(std::string text)
{
    JsonValue value;
    value.type = Type::String;
    value.text = std::move(text);
    return value;
}

JsonValue JsonValue::makeNumber(double number)
{
    JsonValue value;
    value.type = Type::Number;
    value.number = number;
    return value;
}

JsonValue JsonValue::makeFloatArray(const float* values, size_t count)
{
    JsonValue value;
    value.type = Type::Array;
    value.numberArray = true;
    value.float32 = true;
    value.numbers.assign(values, values + count);
    return value;
}

bool JsonValue::parse(std::string_view text, JsonValue* out)
{
    *out = JsonValue();
    Parser parser(text.data(), text.data() + text.size());
    if (!parser.parseDocument(out)) {
        *out = JsonValue();
        return false;
    }
    return true;
}

std::string JsonValue::serialize() const
{
    std::string out;
    serializeTo(&out);
    return out;
}

void JsonValue::serializeTo(std::string* out) const
{
    switch (type) {
    case Type::Null:
        if (marker) {
            out->push_back(marker);
        } else {
            out->append("null");
        }
        return;
    case Type::Bool:
        out->append(boolean ? "true" : "false");
        return;
    case Type::Number:
        if (!text.empty()) {
            out->append(text);
        } else {
            appendDouble(out, number);
        }
        return;
    case Type::String:
        appendEscaped(out, text);
        return;
    case Type::Array:
        out->push_back('[');
        if (numberArray && float32) {
            // Written straight into the text: at most 24 characters and a comma per number.
            const size_t start = out->size();
            out->resize(start + numbers.size() * 25 + 1);
            char* p = &(*out)[start];
            for (size_t i = 0; i < numbers.size(); ++i) {
                *p = ',';
                p += i ? 1 : 0;
                p += formatFloat(float(numbers[i]), p);
            }
            out->resize(size_t(p - out->data()));
        } else if (numberArray) {
            for (size_t i = 0; i < numbers.size(); ++i) {
                if (i) {
                    out->push_back(',');
                }
                appendDouble(out, numbers[i]);
            }
        } else {
            for (size_t i = 0; i < items.size(); ++i) {
                if (i) {
                    out->push_back(',');
                }
                items[i].serializeTo(out);
            }
        }
        out->push_back(']');
        return;
    case Type::Object:
        out->push_back('{');
        for (size_t i = 0; i < keys.size(); ++i) {
            if (i) {
                out->push_back(',');
            }
            appendEscaped(out, keys[i]);
            out->push_back(':');
            values[i].serializeTo(out);
        }
        out->push_back('}');
        return;
    }
}

} // namespace tamsa
