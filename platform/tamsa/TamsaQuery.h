#pragma once
// A search's conditions, copied out of the caller's query record at First (the record and its
// texts belong to the caller and die when First returns), and the matching rules applied to
// each stored object.

#include "Tamsa.h"
#include <simdjson.h>

#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace tamsa {

struct TrajectoryPoint
{
    double x = 0;
    double y = 0;
};

class TamsaQuery
{
public:
    // Reads and checks the record: TAMSA_OK, TAMSA_E_INVALID_ARGUMENT (size) or TAMSA_E_BAD_QUERY.
    static int32_t compile(const TTAMSA_OBJECTMETAINFO_QUERY& record, TamsaQuery* out);

    // The conditions that SQL does not check: attributes, plate and rule. `plate` is the object's
    // plate text (empty when it has none), `attributes` its attribute object's text. Any thread.
    bool matchesObject(std::string_view attributes, std::string_view plate, const TrajectoryPoint* trajectory,
                       size_t pointCount, uint32_t startTime, uint32_t endTime) const;
    // True when matchesObject needs the attribute object (parsing it can be skipped otherwise).
    bool needsAttributes() const { return !m_attributeKeys.empty(); }
    bool isFeatureSearch() const { return !m_body.empty() || !m_face.empty(); }

    uint32_t m_startTime = 0;
    uint32_t m_endTime = 0;
    std::vector<uint32_t> m_locations; // distinct, in the caller's order
    std::string m_objectType;          // empty: any type
    std::vector<std::string> m_attributeKeys;
    std::vector<simdjson::dom::element> m_attributeValues; // in m_attributeTexts' documents
    std::vector<std::shared_ptr<simdjson::dom::parser>> m_attributeTexts;
    std::u32string m_plate; // case-folded pattern; empty: no plate condition
    bool m_hasPlate = false;
    std::vector<TrajectoryPoint> m_trace;
    bool m_loitering = false;
    uint32_t m_duration = 0;
    int32_t m_direction = 0;
    bool m_descending = false;
    bool m_doNotSort = false;
    std::vector<float> m_body; // empty: no body vector
    std::vector<float> m_face;
};

// Case-folded code points of a UTF-8 text (plates, attribute texts).
std::u32string foldCase(std::string_view utf8);
// Does `text` (folded) contain something matching `pattern` (folded; * any run, ? one character)?
bool wildcardContains(const std::u32string& text, const std::u32string& pattern);
// Attribute value equality: numbers numerically, texts case-insensitively, lists element-wise.
bool jsonValuesEqual(simdjson::dom::element a, simdjson::dom::element b);

// Rule checks, exposed for tests. Line: nDirection 0 either way, 1 negative->positive side,
// 2 positive->negative. Zone: entered when a point lies inside or a segment crosses its border;
// loitering: a run of consecutive inside points spans at least `duration` seconds, with the
// object's time spread evenly over its points.
bool crossesLine(const TrajectoryPoint* points, size_t count, const TrajectoryPoint& a,
                 const TrajectoryPoint& b, int direction);
bool entersZone(const TrajectoryPoint* points, size_t count, const std::vector<TrajectoryPoint>& zone);
bool loitersInZone(const TrajectoryPoint* points, size_t count, const std::vector<TrajectoryPoint>& zone,
                   uint32_t startTime, uint32_t endTime, uint32_t duration);

} // namespace tamsa
