#pragma once
// One element of a camera answer ({"ObjectMetaInfo": [element, ...]}), checked and reduced to
// what the store keeps: the first body and face vectors leave the texts and are kept as float32;
// everything else is kept as the camera sent it. In the stored thumbnail text the value of the
// moved "feature" members is a single marker character (kBodyMarker, kFaceMarker), replaced by
// the vector's text (or null) when a search hands the object out.

#include "TamsaJson.h"
#include "TamsaQuery.h"

#include <cstdint>
#include <string>
#include <vector>

namespace tamsa {

constexpr char kBodyMarker = '\x01';
constexpr char kFaceMarker = '\x02';

class TamsaCameraObject
{
public:
    // False when the element is not a valid object (missing member, wrong type, a number out of
    // range, a feature that is not kFeatureDim floats); `out` is then unspecified.
    static bool fromJson(simdjson::dom::element element, TamsaCameraObject* out);

    uint64_t m_id = 0;
    std::string m_type;
    uint32_t m_startTime = 0;
    uint32_t m_endTime = 0;
    std::string m_attributes; // compact JSON object
    std::string m_plate;      // attribute "PlateNumber", else the first plate crop's; may be empty
    std::vector<TrajectoryPoint> m_trajectory;
    std::string m_thumbnails;  // {"Thumbnail": [...], ...} with the kept vectors' "feature" null
    std::vector<float> m_body; // empty or kFeatureDim values
    std::vector<float> m_face;
};

} // namespace tamsa
