#include "TamsaQuery.h"

#include "JsonDom.h"

#include <QList>
#include <QString>

#include <algorithm>
#include <cmath>

namespace tamsa {

namespace {

// A list without its 0 entry must not make us read forever.
constexpr size_t kMaxLocations = 1 << 16;
constexpr size_t kMaxFeatureLength = 1 << 16;

bool isAscii(std::string_view text)
{
    for (char c : text) {
        if (static_cast<unsigned char>(c) >= 0x80) {
            return false;
        }
    }
    return true;
}

using simdjson::dom::element;
using simdjson::dom::element_type;

// Reads an attribute object; null and empty texts mean "no condition".
bool readAttributes(const char* text, TamsaQuery* out)
{
    if (!text || !*text) {
        return true;
    }
    auto parser = std::make_shared<simdjson::dom::parser>();
    element root;
    simdjson::dom::object object;
    if (JsonDom::parse(*parser, text, &root) || root.get_object().get(object)) {
        return false;
    }
    for (const simdjson::dom::key_value_pair member : object) {
        out->m_attributeKeys.emplace_back(member.key);
        out->m_attributeValues.push_back(member.value);
    }
    out->m_attributeTexts.push_back(std::move(parser));
    return true;
}

// [x, y] or {"x": x, "y": y}; the reader refuses non-finite numbers.
bool readPoint(element value, TrajectoryPoint* point)
{
    simdjson::dom::array pair;
    if (!value.get_array().get(pair)) {
        return pair.size() == 2 && !pair.at(0).get_double().get(point->x) &&
               !pair.at(1).get_double().get(point->y);
    }
    return !value["x"].get_double().get(point->x) && !value["y"].get_double().get(point->y);
}

bool readFeature(simdjson::dom::parser& parser, const char* text, std::vector<float>* out)
{
    if (!text || !*text) {
        return true;
    }
    element root;
    simdjson::dom::array numbers;
    if (JsonDom::parse(parser, text, &root) || root.get_array().get(numbers) ||
        numbers.size() > kMaxFeatureLength) {
        return false;
    }
    out->reserve(numbers.size());
    for (element number : numbers) {
        double value = 0;
        if (number.get_double().get(value) || std::fabs(value) > 3.4e38) {
            return false;
        }
        out->push_back(float(value));
    }
    return true;
}

int sign(double value)
{
    return value > 0 ? 1 : (value < 0 ? -1 : 0);
}

double cross(const TrajectoryPoint& o, const TrajectoryPoint& a, const TrajectoryPoint& b)
{
    return (a.x - o.x) * (b.y - o.y) - (a.y - o.y) * (b.x - o.x);
}

bool onSegment(const TrajectoryPoint& p, const TrajectoryPoint& a, const TrajectoryPoint& b)
{
    return std::min(a.x, b.x) <= p.x && p.x <= std::max(a.x, b.x) && std::min(a.y, b.y) <= p.y &&
           p.y <= std::max(a.y, b.y);
}

// Closed segments [p1, p2] and [q1, q2] share at least one point.
bool segmentsIntersect(const TrajectoryPoint& p1, const TrajectoryPoint& p2, const TrajectoryPoint& q1,
                       const TrajectoryPoint& q2)
{
    const int d1 = sign(cross(q1, q2, p1));
    const int d2 = sign(cross(q1, q2, p2));
    const int d3 = sign(cross(p1, p2, q1));
    const int d4 = sign(cross(p1, p2, q2));
    if (d1 * d2 < 0 && d3 * d4 < 0) {
        return true;
    }
    return (d1 == 0 && onSegment(p1, q1, q2)) || (d2 == 0 && onSegment(p2, q1, q2)) ||
           (d3 == 0 && onSegment(q1, p1, p2)) || (d4 == 0 && onSegment(q2, p1, p2));
}

bool insidePolygon(const TrajectoryPoint& p, const std::vector<TrajectoryPoint>& zone)
{
    bool inside = false;
    for (size_t i = 0, j = zone.size() - 1; i < zone.size(); j = i++) {
        const TrajectoryPoint& a = zone[i];
        const TrajectoryPoint& b = zone[j];
        if ((a.y > p.y) != (b.y > p.y) && p.x < (b.x - a.x) * (p.y - a.y) / (b.y - a.y) + a.x) {
            inside = !inside;
        }
    }
    return inside;
}

// An object without a plate matches no pattern but the empty one (Tamsa.h).
bool platePatternMatches(std::string_view plate, std::string_view pattern)
{
    return pattern.empty() || (!plate.empty() && wildcardContains(foldCase(plate), foldCase(pattern)));
}

bool matchesPlate(element query, std::string_view plate)
{
    std::string_view pattern;
    if (!query.get_string().get(pattern)) {
        return platePatternMatches(plate, pattern);
    }
    simdjson::dom::array patterns;
    if (!query.get_array().get(patterns)) {
        for (element item : patterns) {
            if (!item.get_string().get(pattern) && platePatternMatches(plate, pattern)) {
                return true;
            }
        }
    }
    return false;
}

// A query scalar matches an equal object value, or a list holding an equal value.
bool scalarMatches(element query, element object)
{
    simdjson::dom::array list;
    if (!object.get_array().get(list)) {
        for (element item : list) {
            if (jsonValuesEqual(query, item)) {
                return true;
            }
        }
        return false;
    }
    return jsonValuesEqual(query, object);
}

bool memberMatches(element query, element object)
{
    simdjson::dom::array list;
    if (query.get_array().get(list)) {
        return scalarMatches(query, object);
    }
    // A list matches when it shares at least one value with the object's value.
    for (element item : list) {
        if (scalarMatches(item, object)) {
            return true;
        }
    }
    return false;
}

} // namespace

std::u32string foldCase(std::string_view utf8)
{
    std::u32string out;
    if (isAscii(utf8)) {
        out.reserve(utf8.size());
        for (char c : utf8) {
            out.push_back(char32_t(c >= 'A' && c <= 'Z' ? c + 32 : c));
        }
        return out;
    }
    const QList<uint> codes = QString::fromUtf8(utf8.data(), qsizetype(utf8.size())).toCaseFolded().toUcs4();
    out.assign(codes.begin(), codes.end());
    return out;
}

bool wildcardContains(const std::u32string& text, const std::u32string& pattern)
{
    // Iterative glob match of "*pattern*": on a mismatch, the last star absorbs one more character.
    size_t t = 0;
    size_t p = 0;
    size_t starPattern = 0; // a virtual leading star
    size_t starText = 0;
    bool haveStar = true;
    while (t < text.size()) {
        if (p < pattern.size() && (pattern[p] == U'?' || pattern[p] == text[t])) {
            ++t;
            ++p;
        } else if (p < pattern.size() && pattern[p] == U'*') {
            haveStar = true;
            starPattern = ++p;
            starText = t;
        } else if (p == pattern.size()) {
            return true; // the trailing virtual star takes the rest
        } else if (haveStar) {
            p = starPattern;
            t = ++starText;
        } else {
            return false;
        }
    }
    while (p < pattern.size() && pattern[p] == U'*') {
        ++p;
    }
    return p == pattern.size();
}

bool jsonValuesEqual(element a, element b)
{
    if (a.is_number() && b.is_number()) {
        return a.get_double().value_unsafe() == b.get_double().value_unsafe();
    }
    if (a.type() != b.type()) {
        return false;
    }
    switch (a.type()) {
    case element_type::NULL_VALUE:
        return true;
    case element_type::BOOL:
        return a.get_bool().value_unsafe() == b.get_bool().value_unsafe();
    case element_type::STRING: {
        const std::string_view x = a.get_string().value_unsafe();
        const std::string_view y = b.get_string().value_unsafe();
        if (x.size() == y.size() && isAscii(x) && isAscii(y)) {
            for (size_t i = 0; i < x.size(); ++i) {
                const char cx = char(x[i] >= 'A' && x[i] <= 'Z' ? x[i] + 32 : x[i]);
                const char cy = char(y[i] >= 'A' && y[i] <= 'Z' ? y[i] + 32 : y[i]);
                if (cx != cy) {
                    return false;
                }
            }
            return true;
        }
        return foldCase(x) == foldCase(y);
    }
    case element_type::ARRAY: {
        const simdjson::dom::array x = a.get_array().value_unsafe();
        const simdjson::dom::array y = b.get_array().value_unsafe();
        if (x.size() != y.size()) {
            return false;
        }
        return std::equal(x.begin(), x.end(), y.begin(),
                          [](element p, element q) { return jsonValuesEqual(p, q); });
    }
    case element_type::OBJECT: {
        const simdjson::dom::object x = a.get_object().value_unsafe();
        const simdjson::dom::object y = b.get_object().value_unsafe();
        if (x.size() != y.size()) {
            return false;
        }
        for (const simdjson::dom::key_value_pair member : x) {
            element other;
            if (y[member.key].get(other) || !jsonValuesEqual(member.value, other)) {
                return false;
            }
        }
        return true;
    }
    default:
        return false; // numbers of either side alone
    }
}

bool crossesLine(const TrajectoryPoint* points, size_t count, const TrajectoryPoint& a,
                 const TrajectoryPoint& b, int direction)
{
    auto side = [&](const TrajectoryPoint& p) {
        return sign((b.x - a.x) * (p.y - a.y) - (b.y - a.y) * (p.x - a.x));
    };
    size_t last = 0;
    int lastSide = 0;
    for (size_t j = 0; j < count; ++j) {
        const int s = side(points[j]);
        if (s == 0) {
            continue; // on the line: the crossing is decided by the next point off it
        }
        if (lastSide != 0 && s != lastSide) {
            bool touches = false;
            for (size_t k = last; k < j && !touches; ++k) {
                touches = segmentsIntersect(points[k], points[k + 1], a, b);
            }
            const int crossed = lastSide < 0 ? 1 : 2;
            if (touches && (direction == 0 || direction == crossed)) {
                return true;
            }
        }
        last = j;
        lastSide = s;
    }
    return false;
}

bool entersZone(const TrajectoryPoint* points, size_t count, const std::vector<TrajectoryPoint>& zone)
{
    for (size_t i = 0; i < count; ++i) {
        if (insidePolygon(points[i], zone)) {
            return true;
        }
    }
    for (size_t i = 0; i + 1 < count; ++i) {
        for (size_t e = 0, f = zone.size() - 1; e < zone.size(); f = e++) {
            if (segmentsIntersect(points[i], points[i + 1], zone[f], zone[e])) {
                return true;
            }
        }
    }
    return false;
}

bool loitersInZone(const TrajectoryPoint* points, size_t count, const std::vector<TrajectoryPoint>& zone,
                   uint32_t startTime, uint32_t endTime, uint32_t duration)
{
    const double span = endTime > startTime ? double(endTime - startTime) : 0.0;
    auto timeAt = [&](size_t i) { return count > 1 ? span * double(i) / double(count - 1) : 0.0; };
    bool inRun = false;
    double runStart = 0;
    for (size_t i = 0; i < count; ++i) {
        if (!insidePolygon(points[i], zone)) {
            inRun = false;
            continue;
        }
        if (!inRun) {
            inRun = true;
            runStart = timeAt(i);
        }
        if (timeAt(i) - runStart >= double(duration)) {
            return true;
        }
    }
    return false;
}

int32_t TamsaQuery::compile(const TTAMSA_OBJECTMETAINFO_QUERY& record, TamsaQuery* out)
{
    if (record.wSize != sizeof(TTAMSA_OBJECTMETAINFO_QUERY)) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    out->m_startTime = record.dwStartTime;
    out->m_endTime = record.dwEndTime;
    if (record.pdwLocationIds) {
        for (size_t i = 0; i < kMaxLocations && record.pdwLocationIds[i] != 0; ++i) {
            const uint32_t location = record.pdwLocationIds[i];
            if (std::find(out->m_locations.begin(), out->m_locations.end(), location) ==
                out->m_locations.end()) {
                out->m_locations.push_back(location);
            }
        }
    }
    if (record.pszObjectType) {
        out->m_objectType = record.pszObjectType;
    }
    if (!readAttributes(record.pszPrimaryAttributes, out) ||
        !readAttributes(record.pszOtherAttributes, out)) {
        return TAMSA_E_BAD_QUERY;
    }
    if (record.pszPlateNumber && *record.pszPlateNumber) {
        out->m_hasPlate = true;
        out->m_plate = foldCase(record.pszPlateNumber);
    }
    simdjson::dom::parser parser; // trace and vectors, read one after the other
    if (record.pszTrace && *record.pszTrace) {
        element root;
        simdjson::dom::array trace;
        if (JsonDom::parse(parser, record.pszTrace, &root) || root.get_array().get(trace) ||
            trace.size() < 2) {
            return TAMSA_E_BAD_QUERY;
        }
        for (element item : trace) {
            TrajectoryPoint point;
            if (!readPoint(item, &point)) {
                return TAMSA_E_BAD_QUERY; // a flat number list such as [1,2] is not a list of points
            }
            out->m_trace.push_back(point);
        }
        if (out->m_trace.size() == 2 && (record.nDirection < 0 || record.nDirection > 2)) {
            return TAMSA_E_BAD_QUERY;
        }
    }
    out->m_loitering = record.bLoitering != 0;
    out->m_duration = record.dwDuration;
    out->m_direction = record.nDirection;
    out->m_descending = record.bDescending != 0;
    out->m_doNotSort = record.bDoNotSort != 0;
    if (!readFeature(parser, record.pszFeature, &out->m_body) ||
        !readFeature(parser, record.pszFaceFeature, &out->m_face)) {
        return TAMSA_E_BAD_QUERY;
    }
    return TAMSA_OK;
}

bool TamsaQuery::matchesObject(std::string_view attributes, std::string_view plate,
                               const TrajectoryPoint* trajectory, size_t pointCount, uint32_t startTime,
                               uint32_t endTime) const
{
    if (m_hasPlate && !wildcardContains(foldCase(plate), m_plate)) {
        return false;
    }
    element root;
    simdjson::dom::object object;
    // A damaged text matches no attribute condition.
    const bool readable =
        needsAttributes() && !JsonDom::parseSmall(attributes, &root) && !root.get_object().get(object);
    for (size_t i = 0; i < m_attributeKeys.size(); ++i) {
        if (m_attributeKeys[i] == "PlateNumber") {
            if (!matchesPlate(m_attributeValues[i], plate)) {
                return false;
            }
            continue;
        }
        element value;
        if (!readable || object[m_attributeKeys[i]].get(value) ||
            !memberMatches(m_attributeValues[i], value)) {
            return false;
        }
    }
    if (m_trace.size() == 2) {
        return crossesLine(trajectory, pointCount, m_trace[0], m_trace[1], m_direction);
    }
    if (m_trace.size() >= 3) {
        if (m_loitering) {
            return loitersInZone(trajectory, pointCount, m_trace, startTime, endTime, m_duration);
        }
        return entersZone(trajectory, pointCount, m_trace);
    }
    return true;
}

} // namespace tamsa
