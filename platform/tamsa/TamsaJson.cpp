#include "TamsaJson.h"

#include <charconv>
#include <cmath>
#include <cstring>

namespace tamsa {

void appendJsonString(std::string* out, std::string_view text)
{
    out->push_back('"');
    size_t runStart = 0;
    for (size_t i = 0; i < text.size(); ++i) {
        const unsigned char c = static_cast<unsigned char>(text[i]);
        if (c >= 0x20 && c != '"' && c != '\\') {
            continue;
        }
        out->append(text.substr(runStart, i - runStart));
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
    out->append(text.substr(runStart));
    out->push_back('"');
}

namespace {

// Replaces the comma after the last member (or closes the empty one after its opening bracket).
void closeWith(std::string* out, char open, char close)
{
    if (out->back() == open) {
        out->push_back(close);
    } else {
        out->back() = close;
    }
}

} // namespace

void appendJson(std::string* out, simdjson::dom::element value)
{
    char buffer[40];
    switch (value.type()) {
    case simdjson::dom::element_type::OBJECT: {
        out->push_back('{');
        const simdjson::dom::object members = value.get_object().value_unsafe();
        for (const simdjson::dom::key_value_pair member : members) {
            appendJsonString(out, member.key);
            out->push_back(':');
            appendJson(out, member.value);
            out->push_back(',');
        }
        closeWith(out, '{', '}');
        return;
    }
    case simdjson::dom::element_type::ARRAY: {
        out->push_back('[');
        const simdjson::dom::array items = value.get_array().value_unsafe();
        for (const simdjson::dom::element item : items) {
            appendJson(out, item);
            out->push_back(',');
        }
        closeWith(out, '[', ']');
        return;
    }
    case simdjson::dom::element_type::STRING:
        appendJsonString(out, value.get_string().value_unsafe());
        return;
    case simdjson::dom::element_type::INT64:
        out->append(buffer,
                    std::to_chars(buffer, buffer + sizeof buffer, value.get_int64().value_unsafe()).ptr);
        return;
    case simdjson::dom::element_type::UINT64:
        out->append(buffer,
                    std::to_chars(buffer, buffer + sizeof buffer, value.get_uint64().value_unsafe()).ptr);
        return;
    case simdjson::dom::element_type::DOUBLE:
        // The parser refuses non-finite numbers; the shortest text that reads back the same.
        out->append(buffer,
                    std::to_chars(buffer, buffer + sizeof buffer, value.get_double().value_unsafe()).ptr);
        return;
    case simdjson::dom::element_type::BOOL:
        out->append(value.get_bool().value_unsafe() ? "true" : "false");
        return;
    case simdjson::dom::element_type::NULL_VALUE:
        out->append("null");
        return;
    }
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

} // namespace tamsa
