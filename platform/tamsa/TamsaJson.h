#pragma once
// A small JSON tree for the store: camera answers (large number arrays) and query texts.
//
// Why not QJsonDocument: an ingest parses about a thousand feature numbers per object, and a
// search turns a thousand floats per record back into text; both must run at tens of thousands
// of objects per second. Arrays that hold only numbers are kept as a flat vector of doubles.
// Parsing hostile text never crashes: depth is limited, numbers that do not fit are infinite
// (callers reject them), and any syntax error makes parse() return false.

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace tamsa {

class JsonValue
{
public:
    enum class Type : uint8_t
    {
        Null,
        Bool,
        Number,
        String,
        Array,
        Object
    };

    Type type = Type::Null;
    bool boolean = false;
    double number = 0;
    // String: the decoded text. Number: the number as written (so 64-bit ids stay exact).
    std::string text;
    // Array of numbers only: the values here and `items` empty. Any other array uses `items`.
    bool numberArray = false;
    // A float32 vector handed out by the store: written with float precision, not double.
    bool float32 = false;
    // Null only: written as this single control character instead of "null". Real texts never
    // hold one unescaped, so the store uses it to mark where a vector goes back in.
    char marker = 0;
    std::vector<double> numbers;
    std::vector<JsonValue> items;
    // Object members in their order (parallel vectors).
    std::vector<std::string> keys;
    std::vector<JsonValue> values;

    bool isNull() const { return type == Type::Null; }
    bool isNumber() const { return type == Type::Number; }
    bool isString() const { return type == Type::String; }
    bool isArray() const { return type == Type::Array; }
    bool isObject() const { return type == Type::Object; }
    size_t arraySize() const { return numberArray ? numbers.size() : items.size(); }
    // Element i of an array as a value (numbers of a number array come back as Number values).
    JsonValue arrayElement(size_t i) const;

    // Object member by name (first of duplicates), or null when missing or not an object.
    const JsonValue* member(std::string_view key) const;
    JsonValue* member(std::string_view key);
    void setMember(std::string_view key, JsonValue value);

    static JsonValue makeString(std::string text);
    static JsonValue makeNumber(double value);
    static JsonValue makeFloatArray(const float* values, size_t count);

    // Parses one complete JSON text (surrounding white space allowed).
    static bool parse(std::string_view text, JsonValue* out);
    // Compact text.
    std::string serialize() const;
    void serializeTo(std::string* out) const;
};

// Writes a float so that reading it back as a float gives the same value, quickly (9 significant
// digits, trailing zeros dropped). Returns the number of characters written (<= 24).
int formatFloat(float value, char* out);

// Appends [v0,v1,...] written with formatFloat.
void appendFloatArray(std::string* out, const float* values, size_t count);

// Parses a JSON number at [begin, end): fast path for the short decimals that feature vectors
// use, exact fallback otherwise. Returns the end of the number or null when it is not one.
const char* parseNumber(const char* begin, const char* end, double* value);

} // namespace tamsa
