#include "StoreFixture.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstring>
#include <numeric>
#include <random>

namespace storetest {

std::vector<float> randomUnitVector(uint32_t seed)
{
    std::mt19937 random(seed);
    std::normal_distribution<float> normal(0.0f, 1.0f);
    std::vector<float> vector(kDim);
    for (float& value : vector) {
        value = normal(random);
    }
    const double norm = std::sqrt(std::inner_product(vector.begin(), vector.end(), vector.begin(), 0.0));
    for (float& value : vector) {
        value = float(value / norm);
    }
    return vector;
}

std::vector<float> noisyCopy(const std::vector<float>& base, float noise, uint32_t seed)
{
    std::vector<float> copy = randomUnitVector(seed);
    for (size_t i = 0; i < base.size(); ++i) {
        copy[i] = base[i] + noise * copy[i];
    }
    return copy;
}

float plainCosine(const std::vector<float>& a, const std::vector<float>& b)
{
    const auto dot = [](const std::vector<float>& x, const std::vector<float>& y) {
        return std::inner_product(x.begin(), x.end(), y.begin(), 0.0);
    };
    return float(std::max(0.0, dot(a, b) / std::sqrt(dot(a, a) * dot(b, b))));
}

std::string jsonArray(const std::vector<float>& values)
{
    std::string text;
    char buffer[32];
    for (float value : values) {
        text +=
            (text.empty() ? "[" : ",") + std::string(buffer, std::to_chars(buffer, buffer + 32, value).ptr);
    }
    return text.empty() ? "[]" : text + "]";
}

std::string objectJson(const ObjectSpec& object)
{
    std::string trajectory;
    for (const auto& [x, y] : object.trajectory) {
        trajectory += (trajectory.empty() ? "" : ",") + ("{\"x\":" + std::to_string(x)) +
                      ",\"y\":" + std::to_string(y) + "}";
    }
    std::string text = "{\"ID\":" + std::to_string(object.id) + ",\"ObjectType\":\"" + object.type +
                       "\",\"StartTime\":" + std::to_string(object.start) +
                       ",\"EndTime\":" + std::to_string(object.end) + ",\"Attributes\":" + object.attributes +
                       ",\"Trajectory\":[" + trajectory + "],\"Thumbnail\":[{\"image\":\"aW1hZ2U" +
                       std::to_string(object.id) + "\"" +
                       (object.body.empty() ? "" : ",\"feature\":" + jsonArray(object.body)) + "}]";
    if (!object.face.empty()) {
        text += ",\"FaceThumbnail\":[{\"image\":\"ZmFjZQ\",\"feature\":" + jsonArray(object.face) +
                ",\"face_detection_info\":{\"filtered\":" + (object.faceFiltered ? "1" : "0") + "}}]";
    }
    if (!object.plateCrop.empty()) {
        text += ",\"LicensePlateThumbnail\":[{\"image\":\"cGxhdGU\",\"PlateNumber\":\"" + object.plateCrop +
                "\",\"detection_info\":{\"filtered\":0}}]";
    }
    return text + "}";
}

std::string answerJson(const std::vector<ObjectSpec>& objects)
{
    std::string text;
    for (const ObjectSpec& object : objects) {
        text += (text.empty() ? "" : ",") + objectJson(object);
    }
    return "{\"ObjectMetaInfo\":[" + text + "]}";
}

std::vector<ObjectSpec> numberedObjects(uint64_t firstId, size_t count, bool withVectors)
{
    std::vector<ObjectSpec> objects;
    for (uint64_t id = firstId; id < firstId + count; ++id) {
        ObjectSpec& made =
            objects.emplace_back(ObjectSpec{id, "Human", uint32_t(1000 + id), uint32_t(1005 + id)});
        made.attributes =
            R"({"Gender":)" + std::to_string(id % 2) + R"(,"Tag":"object )" + std::to_string(id) + "\"}";
        made.body = withVectors ? randomUnitVector(uint32_t(id)) : std::vector<float>();
        made.face =
            withVectors && id % 3 == 0 ? randomUnitVector(uint32_t(id + 100000)) : std::vector<float>();
    }
    return objects;
}

TTAMSA_OBJECTMETAINFO_QUERY makeQuery(const QueryOptions& options, std::vector<uint32_t>* locationsOut)
{
    TTAMSA_OBJECTMETAINFO_QUERY query;
    std::memset(&query, 0, sizeof query);
    *locationsOut = options.locations;
    locationsOut->push_back(0);
    auto text = [](const std::string& value) { return value.empty() ? nullptr : value.c_str(); };
    query.wSize = sizeof query, query.dwStartTime = options.start, query.dwEndTime = options.end;
    query.pdwLocationIds = options.nullLocations ? nullptr : locationsOut->data();
    query.pszObjectType = text(options.type), query.pszPrimaryAttributes = text(options.primary);
    query.pszOtherAttributes = text(options.other), query.pszTrace = text(options.trace);
    query.dwDuration = options.duration, query.bLoitering = options.loitering;
    query.bDescending = options.descending, query.bDoNotSort = options.doNotSort,
    query.nDirection = options.direction;
    query.pszFeature = text(options.feature), query.pszFaceFeature = text(options.faceFeature);
    query.pszPlateNumber = text(options.plate);
    return query;
}

void* openStore(const std::string& directory)
{
    unsigned char record[704] = {704 & 0xFF, 704 >> 8};
    void* database = nullptr;
    if (Tamsa_InitDatabase(&database, record, 0) == TAMSA_OK &&
        Tamsa_SetStoragesDBPath(database, directory.c_str()) != TAMSA_OK) {
        Tamsa_ReleaseDatabase(&database);
    }
    return database;
}

std::vector<ResultCopy> searchStore(void* database, const QueryOptions& options, int32_t* status)
{
    std::vector<uint32_t> locations;
    const TTAMSA_OBJECTMETAINFO_QUERY query = makeQuery(options, &locations);
    void* search = nullptr;
    std::vector<ResultCopy> results;
    int32_t code = Tamsa_GetObjectMetaInfoFirst(database, &query, &search);
    if (code == TAMSA_OK) {
        TTAMSA_OBJECTMETAINFO_RESULT r{};
        r.wSize = sizeof r;
        while ((code = Tamsa_GetObjectMetaInfoNext(search, &r)) == TAMSA_OK) {
            results.push_back({r.qwObjectId, r.dwLocationNumber, r.pszObjectType, r.pszAttributes,
                               r.dwStartTime, r.dwEndTime,
                               std::vector<double>(r.pTrajectory, r.pTrajectory + r.dwTrajectoryBytes / 8),
                               r.pszThumbnails, r.fScore, r.fFaceScore});
        }
        Tamsa_GetObjectMetaInfoClose(search);
    }
    if (status) {
        *status = code;
    } else {
        EXPECT_EQ(code, TAMSA_E_NO_MORE_RECORDS);
    }
    return results;
}

Ids idsOf(const std::vector<ResultCopy>& results)
{
    Ids ids(results.size());
    std::transform(results.begin(), results.end(), ids.begin(), [](const ResultCopy& r) { return r.id; });
    return ids;
}

void StoreFixture::SetUp()
{
    ASSERT_TRUE(m_dir.isValid());
    m_database = openHandle();
    ASSERT_NE(m_database, nullptr);
}

} // namespace storetest
