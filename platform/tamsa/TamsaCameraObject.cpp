#include "TamsaCameraObject.h"

#include "TamsaFeatureFile.h"

#include <cmath>
#include <string_view>

namespace tamsa {

namespace {

using simdjson::dom::element;
using simdjson::dom::element_type;

constexpr size_t kMaxTypeLength = 64;

// "ID" must be written as a plain non-negative integer that fits 64 bits (doubles lose digits).
bool readId(simdjson::dom::object object, uint64_t* out)
{
    element value;
    if (object["ID"].get(value) ||
        (value.type() != element_type::UINT64 && value.type() != element_type::INT64)) {
        return false;
    }
    return !value.get_uint64().get(*out); // a negative INT64 is refused here
}

bool readTime(simdjson::dom::object object, const char* name, uint32_t* out)
{
    double number = 0;
    if (object[name].get_double().get(number) || number < 0 || number > 4294967295.0) {
        return false;
    }
    *out = uint32_t(number);
    return true;
}

bool readTrajectory(simdjson::dom::object object, std::vector<TrajectoryPoint>* out)
{
    element value;
    if (object["Trajectory"].get(value)) {
        return true; // none
    }
    simdjson::dom::array points;
    if (value.get_array().get(points)) {
        return false;
    }
    out->reserve(points.size());
    for (element point : points) {
        double x = 0;
        double y = 0;
        if (point["x"].get_double().get(x) || point["y"].get_double().get(y)) {
            return false;
        }
        out->push_back({x, y});
    }
    return true;
}

// The "feature" of the first element of a crop array, as floats. A missing array, element or
// feature (or null) is fine and leaves `vector` empty; a malformed feature is not.
bool readFeature(element crops, std::vector<float>* vector, element* feature)
{
    simdjson::dom::object first;
    if (crops.at(0).get_object().get(first) || first["feature"].get(*feature) || feature->is_null()) {
        return true;
    }
    simdjson::dom::array numbers;
    if (feature->get_array().get(numbers) || numbers.size() != kFeatureDim) {
        return false;
    }
    vector->reserve(kFeatureDim);
    for (element number : numbers) {
        double value = 0;
        if (number.get_double().get(value) || std::fabs(value) > 3.4e38) {
            return false;
        }
        vector->push_back(float(value));
    }
    return true;
}

// Writes the crop array with the first element's feature (when taken) replaced by the marker.
void appendCrops(std::string* out, element crops, bool taken, char marker)
{
    if (!taken) {
        appendJson(out, crops);
        return;
    }
    out->push_back('[');
    bool firstElement = true;
    const simdjson::dom::array list = crops.get_array().value_unsafe();
    for (element crop : list) {
        if (!firstElement) {
            out->push_back(',');
            appendJson(out, crop);
            continue;
        }
        firstElement = false;
        out->push_back('{');
        bool firstMember = true;
        bool replaced = false; // a repeated name keeps its own value: readFeature took the first
        const simdjson::dom::object members = crop.get_object().value_unsafe();
        for (const simdjson::dom::key_value_pair member : members) {
            out->append(firstMember ? "" : ",");
            firstMember = false;
            appendJsonString(out, member.key);
            out->push_back(':');
            if (member.key == "feature" && !replaced) {
                out->push_back(marker);
                replaced = true;
            } else {
                appendJson(out, member.value);
            }
        }
        out->push_back('}');
    }
    out->push_back(']');
}

} // namespace

bool TamsaCameraObject::fromJson(simdjson::dom::element element, TamsaCameraObject* out)
{
    simdjson::dom::object object;
    std::string_view type;
    if (element.get_object().get(object) || !readId(object, &out->m_id) ||
        object["ObjectType"].get_string().get(type) || type.empty() || type.size() > kMaxTypeLength) {
        return false;
    }
    out->m_type = type;
    if (!readTime(object, "StartTime", &out->m_startTime) || !readTime(object, "EndTime", &out->m_endTime) ||
        out->m_endTime < out->m_startTime) {
        return false;
    }
    simdjson::dom::element attributes;
    const bool hasAttributes = !object["Attributes"].get(attributes);
    if (hasAttributes && !attributes.is_object()) {
        return false;
    }
    out->m_attributes.clear();
    if (hasAttributes) {
        appendJson(&out->m_attributes, attributes);
    } else {
        out->m_attributes = "{}";
    }
    if (!readTrajectory(object, &out->m_trajectory)) {
        return false;
    }

    // Body crops are always written, the other two only when sent; all must be arrays.
    static constexpr const char* kCropNames[] = {"Thumbnail", "FaceThumbnail", "LicensePlateThumbnail"};
    simdjson::dom::element crops[3];
    bool present[3] = {};
    for (int i = 0; i < 3; ++i) {
        present[i] = !object[kCropNames[i]].get(crops[i]);
        if (present[i] && !crops[i].is_array()) {
            return false;
        }
    }
    simdjson::dom::element bodyFeature;
    simdjson::dom::element faceFeature;
    out->m_body.clear();
    out->m_face.clear();
    if ((present[0] && !readFeature(crops[0], &out->m_body, &bodyFeature)) ||
        (present[1] && !readFeature(crops[1], &out->m_face, &faceFeature))) {
        return false;
    }

    out->m_plate.clear();
    std::string_view plate;
    simdjson::dom::object firstPlate;
    if (hasAttributes && !attributes["PlateNumber"].get_string().get(plate)) {
        out->m_plate = plate;
    } else if (present[2] && !crops[2].at(0).get_object().get(firstPlate) &&
               !firstPlate["PlateNumber"].get_string().get(plate)) {
        out->m_plate = plate;
    }

    out->m_thumbnails = "{\"Thumbnail\":";
    if (present[0]) {
        appendCrops(&out->m_thumbnails, crops[0], !out->m_body.empty(), kBodyMarker);
    } else {
        out->m_thumbnails += "[]";
    }
    for (int i = 1; i < 3; ++i) {
        if (present[i]) {
            out->m_thumbnails += ',';
            appendJsonString(&out->m_thumbnails, kCropNames[i]);
            out->m_thumbnails += ':';
            appendCrops(&out->m_thumbnails, crops[i], i == 1 && !out->m_face.empty(), kFaceMarker);
        }
    }
    out->m_thumbnails += '}';
    return true;
}

} // namespace tamsa
