#include "JsonVariantReader.h"

#include "JsonDom.h"

#include <QString>
#include <QVariantList>
#include <QVariantMap>

#include <cmath>
#include <string_view>

namespace {

using simdjson::dom::element;
using simdjson::dom::element_type;

QString toQString(std::string_view utf8)
{
    return QString::fromUtf8(utf8.data(), qsizetype(utf8.size()));
}

// A number as QJsonDocument keeps it; !ok where the tree could differ from QJsonDocument's.
struct Number
{
    bool ok = true;
    bool integer = true;
    qlonglong whole = 0;
    double real = 0;
};

Number readNumber(element value)
{
    Number number;
    switch (value.type()) {
    case element_type::INT64:
        number.whole = value.get_int64().value_unsafe();
        return number;
    case element_type::UINT64: // above the largest qlonglong
        number.integer = false;
        number.real = double(value.get_uint64().value_unsafe());
        return number;
    default:
        break;
    }
    number.real = value.get_double().value_unsafe();
    // A written fraction or exponent that gives zero may have underflowed, which QJsonDocument
    // refuses; subnormals it may round otherwise.
    number.ok = std::isnormal(number.real);
    // QJsonDocument keeps a number that has an exact 64-bit integer value as an integer.
    constexpr double twoTo63 = 9223372036854775808.0;
    number.whole = number.real >= -twoTo63 && number.real < twoTo63 ? qlonglong(number.real) : 0;
    number.integer = double(number.whole) == number.real;
    return number;
}

bool toVariant(element value, QVariant* out)
{
    switch (value.type()) {
    case element_type::OBJECT: {
        QVariantMap map;
        const simdjson::dom::object members = value.get_object().value_unsafe();
        for (const simdjson::dom::key_value_pair member : members) {
            QVariant converted;
            if (!toVariant(member.value, &converted)) {
                return false;
            }
            map.insert(toQString(member.key), std::move(converted)); // a repeated name keeps its last value
        }
        *out = QVariant(std::move(map));
        return true;
    }
    case element_type::ARRAY: {
        QVariantList list;
        const simdjson::dom::array items = value.get_array().value_unsafe();
        list.reserve(qsizetype(items.size()));
        for (const element item : items) {
            if (item.is_number()) {
                // Feature vectors: numbers straight into the list, without a temporary.
                const Number number = readNumber(item);
                if (!number.ok) {
                    return false;
                }
                if (number.integer) {
                    list.emplaceBack(number.whole);
                } else {
                    list.emplaceBack(number.real);
                }
                continue;
            }
            list.emplace_back();
            if (!toVariant(item, &list.back())) {
                return false;
            }
        }
        *out = QVariant(std::move(list));
        return true;
    }
    case element_type::STRING:
        *out = QVariant(toQString(value.get_string().value_unsafe()));
        return true;
    case element_type::BOOL:
        *out = QVariant(value.get_bool().value_unsafe());
        return true;
    case element_type::NULL_VALUE:
        *out = QVariant::fromValue(nullptr);
        return true;
    default: {
        const Number number = readNumber(value);
        *out = number.integer ? QVariant(number.whole) : QVariant(number.real);
        return number.ok;
    }
    }
}

} // namespace

QVariant JsonVariantReader::read(const char* text, std::size_t length)
{
    element root;
    QVariant tree;
    if (!text || JsonDom::parseSmall(std::string_view(text, length), &root) ||
        (!root.is_object() && !root.is_array()) || !toVariant(root, &tree)) {
        return QVariant();
    }
    return tree;
}
