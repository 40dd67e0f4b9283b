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

// False where the tree could differ from QJsonDocument's.
bool number(element value, QVariant* out)
{
    switch (value.type()) {
    case element_type::INT64:
        *out = QVariant(qlonglong(value.get_int64().value_unsafe()));
        return true;
    case element_type::UINT64: // above the largest qlonglong
        *out = QVariant(double(value.get_uint64().value_unsafe()));
        return true;
    default:
        break;
    }
    const double real = value.get_double().value_unsafe();
    if (!std::isnormal(real)) {
        // A written fraction or exponent that gives zero may have underflowed, which
        // QJsonDocument refuses; subnormals it may round otherwise.
        return false;
    }
    // QJsonDocument keeps a number that has an exact 64-bit integer value as an integer.
    constexpr double twoTo63 = 9223372036854775808.0;
    if (real >= -twoTo63 && real < twoTo63 && double(qlonglong(real)) == real) {
        *out = QVariant(qlonglong(real));
    } else {
        *out = QVariant(real);
    }
    return true;
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
    default:
        return number(value, out);
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
