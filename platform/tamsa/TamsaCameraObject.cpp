#include "TamsaCameraObject.h"

#include "TamsaFeatureFile.h"

#include <cmath>
#include <limits>

namespace tamsa {

namespace {

constexpr size_t kMaxTypeLength = 64;

// "ID" must be written as a plain unsigned integer that fits 64 bits (doubles lose digits).
bool readId(const JsonValue* value, uint64_t* out)
{
    if (!value || !value->isNumber() || value->text.empty() || value->text.size() > 20) {
        return false;
    }
    uint64_t id = 0;
    for (char c : value->text) {
        if (c < '0' || c > '9') {
            return false;
        }
        const uint64_t digit = uint64_t(c - '0');
        if (id > (std::numeric_limits<uint64_t>::max() - digit) / 10) {
            return false;
        }
        id = id * 10 + digit;
    }
    *out = id;
    return true;
}

bool readTime(const JsonValue* value, uint32_t* out)
{
    if (!value || !value->isNumber() || !std::isfinite(value->number) || value->number < 0 ||
        value->number > 4294967295.0) {
        return false;
    }
    *out = uint32_t(value->number);
    return true;
}

bool readTrajectory(const JsonValue* value, std::vector<TrajectoryPoint>* out)
{
    if (!value) {
        return true;
    }
    if (!value->isArray() || (value->numberArray && !value->numbers.empty())) {
        return false;
    }
    out->reserve(value->items.size());
    for (const JsonValue& item : value->items) {
        const JsonValue* x = item.member("x");
        const JsonValue* y = item.member("y");
        if (!item.isObject() || !x || !y || !x->isNumber() || !y->isNumber() || !std::isfinite(x->number) ||
            !std::isfinite(y->number)) {
            return false;
        }
        out->push_back({x->number, y->number});
    }
    return true;
}

// Takes the "feature" of the first element of a thumbnail array into `vector` and leaves the
// marker in its place. A missing array, element or feature is fine; a malformed feature is not.
bool takeFeature(JsonValue* thumbnails, std::vector<float>* vector, char marker)
{
    if (!thumbnails) {
        return true;
    }
    if (!thumbnails->isArray() || thumbnails->numberArray) {
        return thumbnails->isArray() && thumbnails->numbers.empty();
    }
    if (thumbnails->items.empty() || !thumbnails->items[0].isObject()) {
        return true;
    }
    JsonValue* feature = thumbnails->items[0].member("feature");
    if (!feature || feature->isNull()) {
        return true;
    }
    if (!feature->isArray() || !feature->numberArray || feature->numbers.size() != kFeatureDim) {
        return false;
    }
    vector->resize(kFeatureDim);
    for (size_t i = 0; i < kFeatureDim; ++i) {
        const double number = feature->numbers[i];
        if (!std::isfinite(number) || std::fabs(number) > 3.4e38) {
            return false;
        }
        (*vector)[i] = float(number);
    }
    *feature = JsonValue();
    feature->marker = marker;
    return true;
}

} // namespace

bool TamsaCameraObject::fromJson(const JsonValue& element, TamsaCameraObject* out)
{
    if (!element.isObject() || !readId(element.member("ID"), &out->m_id)) {
        return false;
    }
    const JsonValue* type = element.member("ObjectType");
    if (!type || !type->isString() || type->text.empty() || type->text.size() > kMaxTypeLength) {
        return false;
    }
    out->m_type = type->text;
    if (!readTime(element.member("StartTime"), &out->m_startTime) ||
        !readTime(element.member("EndTime"), &out->m_endTime) || out->m_endTime < out->m_startTime) {
        return false;
    }
    const JsonValue* attributes = element.member("Attributes");
    if (attributes && !attributes->isObject()) {
        return false;
    }
    out->m_attributes = attributes ? attributes->serialize() : std::string("{}");
    if (!readTrajectory(element.member("Trajectory"), &out->m_trajectory)) {
        return false;
    }

    JsonValue thumbnails;
    thumbnails.type = JsonValue::Type::Object;
    JsonValue emptyArray;
    emptyArray.type = JsonValue::Type::Array;
    const JsonValue* body = element.member("Thumbnail");
    thumbnails.setMember("Thumbnail", body ? *body : emptyArray);
    for (const char* name : {"FaceThumbnail", "LicensePlateThumbnail"}) {
        if (const JsonValue* crops = element.member(name)) {
            if (!crops->isArray()) {
                return false;
            }
            thumbnails.setMember(name, *crops);
        }
    }
    if (!takeFeature(thumbnails.member("Thumbnail"), &out->m_body, kBodyMarker) ||
        !takeFeature(thumbnails.member("FaceThumbnail"), &out->m_face, kFaceMarker)) {
        return false;
    }

    out->m_plate.clear();
    if (attributes && attributes->member("PlateNumber") && attributes->member("PlateNumber")->isString()) {
        out->m_plate = attributes->member("PlateNumber")->text;
    } else if (const JsonValue* plates = thumbnails.member("LicensePlateThumbnail")) {
        if (!plates->items.empty() && plates->items[0].isObject()) {
            const JsonValue* plate = plates->items[0].member("PlateNumber");
            if (plate && plate->isString()) {
                out->m_plate = plate->text;
            }
        }
    }
    out->m_thumbnails = thumbnails.serialize();
    return true;
}

} // namespace tamsa
