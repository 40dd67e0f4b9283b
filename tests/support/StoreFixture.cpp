#include "StoreFixture.h"

#include <charconv>
#include <cmath>
#include <cstring>
#include <random>

namespace storetest {

std::vector<float> randomUnitVector(uint32_t seed)
{
    std::mt19937 random(seed);
    std::normal_distribution<float> normal(0.0f, 1.0f);
    std::vector<float> vector(kDim);
    double norm = 0;
    for (float& value : vector) {
        value = normal(random);
        norm += double(value) * value;
    }
    for (float& value : vector) {
        value = float(value / std::sqrt(norm));
    }
    return vector;
}

std::vector<float> noisyCopy(const std::vector<float>& base, float noise, uint32_t seed)
{
    const std::vector<float> direction = randomUnitVector(seed);
    std::vector<float> copy(base.size());
    for (size_t i = 0; i < base.size(); ++i) {
        copy[i] = base[i] + noise * direction[i];
    }
    return copy;
}

float plainCosine(const std::vector<float>& a, const std::vector<float>& b)
{
    double dot = 0, na = 0, nb = 0;
    for (size_t i = 0; i < a.size(); ++i) {
        dot += double(a[i]) * b[i];
        na += double(a[i]) * a[i];
        nb += double(b[i]) * b[i];
    }
    return float(std::max(0.0, dot / (std::sqrt(na) * std::sqrt(nb))));
}

std::string jsonArray(const std::vector<float>& values)
{
    std::string text = "[";
    char buffer[32];
    for (size_t i = 0; i < values.size(); ++i) {
        if (i) {
            text += ',';
        }
        text.append(buffer, std::to_chars(buffer, buffer + sizeof buffer, values[i]).ptr);
    }
    return text + "]";
}

std::string objectJson(const ObjectSpec& object)
{
    std::string text = "{\"ID\":" + std::to_string(object.id) + ",\"ObjectType\":\"" + object.type +
                       "\",\"StartTime\":" + std::to_string(object.start) +
                       ",\"EndTime\":" + std::to_string(object.end) + ",\"Attributes\":" + object.attributes +
                       ",\"Trajectory\":[";
    for (size_t i = 0; i < object.trajectory.size(); ++i) {
        text += (i ? ",{\"x\":" : "{\"x\":") + std::to_string(object.trajectory[i].first) +
                ",\"y\":" + std::to_string(object.trajectory[i].second) + "}";
    }
    text += "],\"Thumbnail\":[{\"image\":\"aW1hZ2U" + std::to_string(object.id) + "\"";
    if (!object.body.empty()) {
        text += ",\"feature\":" + jsonArray(object.body);
    }
    text += "}]";
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
    std::string text = "{\"ObjectMetaInfo\":[";
    for (size_t i = 0; i < objects.size(); ++i) {
        if (i) {
            text += ',';
        }
        text += objectJson(objects[i]);
    }
    return text + "]}";
}

TTAMSA_OBJECTMETAINFO_QUERY makeQuery(const QueryOptions& options, std::vector<uint32_t>* locationsOut)
{
    TTAMSA_OBJECTMETAINFO_QUERY query;
    std::memset(&query, 0, sizeof query);
    query.wSize = sizeof query;
    query.dwStartTime = options.start;
    query.dwEndTime = options.end;
    *locationsOut = options.locations;
    locationsOut->push_back(0);
    query.pdwLocationIds = options.nullLocations ? nullptr : locationsOut->data();
    auto text = [](const std::string& value) { return value.empty() ? nullptr : value.c_str(); };
    query.pszObjectType = text(options.type);
    query.pszPrimaryAttributes = text(options.primary);
    query.pszOtherAttributes = text(options.other);
    query.pszTrace = text(options.trace);
    query.dwDuration = options.duration;
    query.bLoitering = options.loitering;
    query.bDescending = options.descending;
    query.nDirection = options.direction;
    query.bDoNotSort = options.doNotSort;
    query.pszFeature = text(options.feature);
    query.pszFaceFeature = text(options.faceFeature);
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
        TTAMSA_OBJECTMETAINFO_RESULT record{};
        record.wSize = sizeof record;
        while ((code = Tamsa_GetObjectMetaInfoNext(search, &record)) == TAMSA_OK) {
            results.push_back(
                {record.qwObjectId, record.dwLocationNumber, record.pszObjectType, record.pszAttributes,
                 record.dwStartTime, record.dwEndTime,
                 std::vector<double>(record.pTrajectory, record.pTrajectory + record.dwTrajectoryBytes / 8),
                 record.pszThumbnails, record.fScore, record.fFaceScore});
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
    Ids ids;
    for (const ResultCopy& result : results) {
        ids.push_back(result.id);
    }
    return ids;
}

void StoreFixture::SetUp()
{
    ASSERT_TRUE(m_dir.isValid());
    m_database = openHandle();
    ASSERT_NE(m_database, nullptr);
}

void StoreFixture::TearDown()
{
    Tamsa_ReleaseDatabase(&m_database);
}

std::string StoreFixture::storagePath() const
{
    return (m_dir.path() + QStringLiteral("/Server")).toStdString();
}

int32_t StoreFixture::put(uint32_t location, const std::vector<ObjectSpec>& objects)
{
    return putText(location, answerJson(objects));
}

int32_t StoreFixture::putText(uint32_t location, const std::string& json)
{
    return Tamsa_PutObjectMetaInfo(m_database, 7, int32_t(location), json.c_str());
}

} // namespace storetest
