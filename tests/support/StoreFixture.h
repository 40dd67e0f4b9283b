#pragma once
// The object-metadata store under test: a fixture that owns a storage folder and a database
// handle, builders for camera answers and query records, and copies of result records. Shared by
// the store's own tests and by searches that run against the real store.

#include "Tamsa.h"

#include <QTemporaryDir>
#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

namespace storetest {

constexpr size_t kDim = 512;
using Ids = std::vector<uint64_t>;

// A unit vector drawn from `seed`; noisyCopy() adds a random direction scaled by `noise`.
std::vector<float> randomUnitVector(uint32_t seed);
std::vector<float> noisyCopy(const std::vector<float>& base, float noise, uint32_t seed);
float plainCosine(const std::vector<float>& a, const std::vector<float>& b);
std::string jsonArray(const std::vector<float>& values);

struct ObjectSpec
{
    uint64_t id = 1;
    std::string type = "Human";
    uint32_t start = 1000, end = 1010;
    std::string attributes = "{}";
    std::vector<std::pair<double, double>> trajectory{};
    std::vector<float> body{}, face{};
    bool faceFiltered = false;
    std::string plateCrop{}; // non-empty: a LicensePlateThumbnail with this PlateNumber
};

std::string objectJson(const ObjectSpec& object);
std::string answerJson(const std::vector<ObjectSpec>& objects);
// Objects firstId.. told apart by their id alone: start time, attributes (Gender, Tag) and, with
// vectors, a body vector of their own and a face vector on every third.
std::vector<ObjectSpec> numberedObjects(uint64_t firstId, size_t count, bool withVectors = true);

struct QueryOptions
{
    uint32_t start = 0, end = 0xFFFFFFFFu;
    std::vector<uint32_t> locations{1};
    std::string type, primary, other, trace, feature, faceFeature, plate;
    uint32_t duration = 0;
    int32_t direction = 0;
    bool nullLocations = false, loitering = false, descending = false, doNotSort = false;
};

struct ResultCopy
{
    uint64_t id = 0;
    uint32_t location = 0;
    std::string type, attributes;
    uint32_t start = 0, end = 0;
    std::vector<double> trajectory;
    std::string thumbnails;
    float score = 0, faceScore = 0;
};

// Builds the record; it points into `options` and `locationsOut`, which must outlive it.
TTAMSA_OBJECTMETAINFO_QUERY makeQuery(const QueryOptions& options, std::vector<uint32_t>* locationsOut);

// A new handle on `directory`, or null; the caller releases it.
void* openStore(const std::string& directory);

// Runs a search to its end on `database`; *status gets the code that ended it (or First's
// failure). Without `status`, anything but the normal end fails the test.
std::vector<ResultCopy> searchStore(void* database, const QueryOptions& options, int32_t* status = nullptr);
Ids idsOf(const std::vector<ResultCopy>& results);

class StoreFixture : public ::testing::Test
{
protected:
    void SetUp() override;
    void TearDown() override { Tamsa_ReleaseDatabase(&m_database); }

    std::string storagePath() const { return (m_dir.path() + QStringLiteral("/Server")).toStdString(); }
    void* openHandle() const { return openStore(storagePath()); }
    int32_t put(uint32_t location, const std::vector<ObjectSpec>& objects)
    {
        return putText(location, answerJson(objects));
    }
    int32_t putText(uint32_t location, const std::string& json)
    {
        return Tamsa_PutObjectMetaInfo(m_database, 7, int32_t(location), json.c_str());
    }
    std::vector<ResultCopy> search(const QueryOptions& options, int32_t* status = nullptr)
    {
        return searchStore(m_database, options, status);
    }
    Ids searchIds(const QueryOptions& options) { return idsOf(search(options)); }

    QTemporaryDir m_dir;
    void* m_database = nullptr;
};

} // namespace storetest
