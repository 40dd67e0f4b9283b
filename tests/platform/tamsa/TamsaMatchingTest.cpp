// Which objects a search returns, and in which order: one table over a few
// hand-made objects, then the scores of feature searches and the result record
// itself.
#include "StoreFixture.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>

#include <algorithm>
#include <functional>

using namespace storetest;

namespace {

class TamsaMatchingTest : public StoreFixture
{};

TEST_F(TamsaMatchingTest, QueriesSelectAndOrderTheRightObjects)
{
    // The walker crosses x = 0.5 from the positive side, entering the zone only between points; the
    // returner stays long and crosses the other way above the zone; the van's plate is known only
    // from its plate crop, and it passes beyond the line's end.
    const std::string adult = R"({"Age":"Adult","Gender":1,"UpperColor":[2,5],"Accessories":[]})";
    const ObjectSpec walker{1, "Human", 100, 200, adult, {{0.1, 0.5}, {0.3, 0.5}, {0.9, 0.5}}};
    const ObjectSpec returner{2, "Human", 5000, 9000, R"({"Gender":0})", {{0.9, 0.7}, {0.2, 0.7}}};
    const ObjectSpec car{
        3, "Vehicle", 300, 310, R"({"Type":3,"PlateNumber":"ABC-1234"})", {{0.1, 0.1}, {0.4, 0.9}}};
    const ObjectSpec van{4, "Vehicle", 400, 410, "{}", {{0.1, 1.5}, {0.9, 1.5}}, {}, {}, false, "xyz 999"};
    ObjectSpec loiterer{5}; // 11 points over 10 s, points 2..7 inside the zone: a stay of 5 s
    for (int i = 0; i <= 10; ++i) {
        loiterer.trajectory.push_back({i >= 2 && i <= 7 ? 0.55 : 0.7, 0.5});
    }
    const ObjectSpec elsewhere{6, "Human", 150, 160};
    ASSERT_EQ(put(1, {walker, returner, car, van, loiterer}), 5);
    ASSERT_EQ(put(3, {elsewhere}), 1);

    const std::string line = "[[0.5,0],[0.5,1]]";
    const std::string zone = R"([{"x":0.4,"y":0.4},{"x":0.6,"y":0.4},{"x":0.6,"y":0.6},{"x":0.4,"y":0.6}])";
    using Edit = std::function<void(QueryOptions&)>;
    struct Case
    {
        const char* name;
        Edit edit;
        Ids expected; // in this order, unless the query asks for no sorting
        int32_t status = TAMSA_E_NO_MORE_RECORDS;
    };
    const Case cases[] = {
        {"all, by start time", [](QueryOptions&) {}, {1, 3, 4, 5, 2}},
        {"descending", [](QueryOptions& q) { q.descending = true; }, {2, 5, 4, 3, 1}},
        {"unsorted", [](QueryOptions& q) { q.doNotSort = q.descending = true; }, {1, 2, 3, 4, 5}},
        {"window from an end", [](QueryOptions& q) { q.start = 200, q.end = 300; }, {1, 3}},
        {"window up to a start", [](QueryOptions& q) { q.start = 50, q.end = 100; }, {1}},
        {"window between", [](QueryOptions& q) { q.start = 201, q.end = 299; }, {}},
        {"window inside a stay", [](QueryOptions& q) { q.start = 6000, q.end = 6001; }, {2}},
        {"inverted window", [](QueryOptions& q) { q.start = 300, q.end = 100; }, {}},
        {"other location", [](QueryOptions& q) { q.locations = {3}; }, {6}},
        {"locations merged, repeats once",
         [](QueryOptions& q) {
             q.locations = {1, 3, 1};
         },
         {1, 6, 3, 4, 5, 2}},
        {"empty location list", [](QueryOptions& q) { q.locations = {}; }, {}},
        {"no location list", [](QueryOptions& q) { q.nullLocations = true; }, {}},
        {"type", [](QueryOptions& q) { q.type = "Vehicle"; }, {3, 4}},
        {"lists share a value", [](QueryOptions& q) { q.primary = R"({"UpperColor":[5,7]})"; }, {1}},
        {"lists share none", [](QueryOptions& q) { q.primary = R"({"UpperColor":[7,8]})"; }, {}},
        {"scalar in a list", [](QueryOptions& q) { q.primary = R"({"UpperColor":2})"; }, {1}},
        {"list holds the scalar", [](QueryOptions& q) { q.primary = R"({"Gender":[0,1]})"; }, {1, 2}},
        {"list misses the scalar", [](QueryOptions& q) { q.primary = R"({"Gender":[3,2]})"; }, {}},
        {"numbers by value", [](QueryOptions& q) { q.primary = R"({"Gender":1.0})"; }, {1}},
        {"a text is no number", [](QueryOptions& q) { q.primary = R"({"Gender":"1"})"; }, {}},
        {"texts ignore case", [](QueryOptions& q) { q.primary = R"({"Age":"aDULT"})"; }, {1}},
        {"other text", [](QueryOptions& q) { q.primary = R"({"Age":"Child"})"; }, {}},
        {"missing attribute", [](QueryOptions& q) { q.primary = R"({"Hat":1})"; }, {}},
        {"empty list", [](QueryOptions& q) { q.primary = R"({"Accessories":[]})"; }, {}},
        {"primary and other",
         [](QueryOptions& q) { q.primary = R"({"Gender":1})", q.other = R"({"UpperColor":[5]})"; },
         {1}},
        {"other fails",
         [](QueryOptions& q) { q.primary = R"({"Gender":1})", q.other = R"({"UpperColor":[9]})"; },
         {}},
        {"empty conditions", [](QueryOptions& q) { q.primary = q.other = "{}"; }, {1, 3, 4, 5, 2}},
        {"attributes not an object", [](QueryOptions& q) { q.primary = "[1]"; }, {}, TAMSA_E_BAD_QUERY},
        {"plate contained", [](QueryOptions& q) { q.plate = "c-12"; }, {3}},
        {"plate star", [](QueryOptions& q) { q.plate = "a*4"; }, {3}},
        {"plate question mark", [](QueryOptions& q) { q.plate = "A?C"; }, {3}},
        {"plate differs", [](QueryOptions& q) { q.plate = "A?B"; }, {}},
        {"plate from the crop", [](QueryOptions& q) { q.plate = "Z 99"; }, {4}},
        {"any plate", [](QueryOptions& q) { q.plate = "*"; }, {3, 4}},
        {"plate attribute", [](QueryOptions& q) { q.primary = R"({"PlateNumber":"*99"})"; }, {4}},
        {"plate and type", [](QueryOptions& q) { q.primary = R"({"PlateNumber":"bc-1","Type":3})"; }, {3}},
        {"line either way", [&](QueryOptions& q) { q.trace = line; }, {1, 2}},
        {"line positive to negative", [&](QueryOptions& q) { q.trace = line, q.direction = 2; }, {1}},
        {"line negative to positive", [&](QueryOptions& q) { q.trace = line, q.direction = 1; }, {2}},
        {"unknown direction",
         [&](QueryOptions& q) { q.trace = line, q.direction = 5; },
         {},
         TAMSA_E_BAD_QUERY},
        {"one-point trace", [](QueryOptions& q) { q.trace = "[[0.5,0.5]]"; }, {}, TAMSA_E_BAD_QUERY},
        {"endless point", [](QueryOptions& q) { q.trace = "[[1e999,0],[0.5,1]]"; }, {}, TAMSA_E_BAD_QUERY},
        {"zone entered", [&](QueryOptions& q) { q.trace = zone; }, {1, 5}},
        {"entry ignores duration", [&](QueryOptions& q) { q.trace = zone, q.duration = 6; }, {1, 5}},
        {"loitering long enough",
         [&](QueryOptions& q) { q.trace = zone, q.loitering = true, q.duration = 5; },
         {5}},
        {"loitering too short",
         [&](QueryOptions& q) { q.trace = zone, q.loitering = true, q.duration = 6; },
         {}},
    };
    for (const Case& c : cases) {
        QueryOptions options;
        c.edit(options);
        int32_t status = 0;
        Ids ids = idsOf(search(options, &status));
        if (options.doNotSort) {
            std::sort(ids.begin(), ids.end());
        }
        EXPECT_EQ(status, c.status) << c.name;
        EXPECT_EQ(ids, c.expected) << c.name;
    }
}

TEST_F(TamsaMatchingTest, FeatureScoresThresholdAndOrder)
{
    const std::vector<float> identity = randomUnitVector(1);
    const std::vector<float> faceIdentity = randomUnitVector(2);
    const ObjectSpec close{1, "Human", 1000, 1010, "{}", {}, noisyCopy(identity, 0.3f, 10)};
    const ObjectSpec farther{2, "Human", 1000, 1010, "{}", {}, noisyCopy(identity, 1.0f, 11)};
    const ObjectSpec stranger{3, "Human", 1000, 1010, "{}", {}, randomUnitVector(12), randomUnitVector(13)};
    // A stranger's body with the identity's face.
    const ObjectSpec faceOnly{
        4, "Human", 1000, 1010, "{}", {}, randomUnitVector(14), noisyCopy(faceIdentity, 0.2f, 15)};
    const ObjectSpec vehicle{5, "Vehicle"};
    ASSERT_EQ(put(1, {close, farther, stranger, faceOnly, vehicle}), 5);

    QueryOptions options;
    options.feature = jsonArray(identity);
    std::vector<ResultCopy> results = search(options);
    ASSERT_EQ(idsOf(results), (Ids{1, 2})) << "best first, strangers below the threshold left out";
    EXPECT_NEAR(results[0].score, plainCosine(identity, close.body), 1e-5);
    EXPECT_NEAR(results[1].score, plainCosine(identity, farther.body), 1e-5);
    EXPECT_EQ(results[0].faceScore, 0.0f) << "no face vector in the query";

    options.faceFeature = jsonArray(faceIdentity);
    results = search(options);
    ASSERT_EQ(results.size(), 3u);
    EXPECT_EQ(results[0].id, 4u) << "the face score is the best of all";
    EXPECT_NEAR(results[0].faceScore, plainCosine(faceIdentity, faceOnly.face), 1e-5);
    EXPECT_NEAR(results[0].score, plainCosine(identity, faceOnly.body), 1e-5)
        << "the other score is filled too";
    for (size_t i = 1; i < results.size(); ++i) {
        EXPECT_GE(std::max(results[i - 1].score, results[i - 1].faceScore),
                  std::max(results[i].score, results[i].faceScore));
    }
    options.doNotSort = true;
    Ids unsorted = idsOf(search(options));
    std::sort(unsorted.begin(), unsorted.end());
    EXPECT_EQ(unsorted, (Ids{1, 2, 4}));

    options = QueryOptions();
    options.feature = jsonArray(identity);
    options.start = 2000; // time still applies to feature searches
    EXPECT_TRUE(search(options).empty());
    options.feature = "[1,2";
    int32_t status = 0;
    search(options, &status);
    EXPECT_EQ(status, TAMSA_E_BAD_QUERY);
}

TEST_F(TamsaMatchingTest, ResultRecordCarriesEverythingStoredAndEndsCleanly)
{
    ObjectSpec person;
    person.id = 18446744073709551615ull;
    person.attributes = R"({"Age":"Adult","Gender":1,"UpperColor":[2,5],"Name":"\ud800\udc00 \u00e9"})";
    person.trajectory = {{0.25, 0.5}, {0.75, 0.125}};
    person.body = randomUnitVector(3);
    person.face = randomUnitVector(4);
    person.faceFiltered = true;
    ASSERT_EQ(put(9, {person}), 1);
    QueryOptions options;
    options.locations = {9};
    const std::vector<ResultCopy> results = search(options);
    ASSERT_EQ(results.size(), 1u);
    const ResultCopy& result = results[0];
    EXPECT_EQ(result.id, person.id);
    EXPECT_EQ(result.location, 9u);
    EXPECT_EQ(result.type, "Human");
    EXPECT_EQ(result.start, person.start);
    EXPECT_EQ(result.end, person.end);
    EXPECT_EQ(result.trajectory, (std::vector<double>{0.25, 0.5, 0.75, 0.125}));
    EXPECT_EQ(QJsonDocument::fromJson(QByteArray::fromStdString(result.attributes)),
              QJsonDocument::fromJson(QByteArray::fromStdString(person.attributes)));
    const QJsonObject thumbnails =
        QJsonDocument::fromJson(QByteArray::fromStdString(result.thumbnails)).object();
    const QJsonObject body = thumbnails.value("Thumbnail").toArray().at(0).toObject();
    EXPECT_EQ(body.value("image").toString(), "aW1hZ2U" + QString::number(person.id));
    const QJsonObject face = thumbnails.value("FaceThumbnail").toArray().at(0).toObject();
    EXPECT_EQ(face.value("face_detection_info").toObject().value("filtered").toInt(), 1);
    const QJsonArray bodyFeature = body.value("feature").toArray();
    const QJsonArray faceFeature = face.value("feature").toArray();
    ASSERT_EQ(bodyFeature.size(), qsizetype(kDim));
    ASSERT_EQ(faceFeature.size(), qsizetype(kDim));
    for (size_t i = 0; i < kDim; ++i) {
        ASSERT_EQ(float(bodyFeature.at(qsizetype(i)).toDouble()), person.body[i]) << i;
        ASSERT_EQ(float(faceFeature.at(qsizetype(i)).toDouble()), person.face[i]) << i;
    }

    // The end code comes after the last record, and again on every later Next.
    std::vector<uint32_t> locations;
    TTAMSA_OBJECTMETAINFO_QUERY query = makeQuery(options, &locations);
    void* search = nullptr;
    ASSERT_EQ(Tamsa_GetObjectMetaInfoFirst(m_database, &query, &search), TAMSA_OK);
    TTAMSA_OBJECTMETAINFO_RESULT record{};
    EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(search, &record), TAMSA_E_INVALID_ARGUMENT) << "wSize not set";
    record.wSize = sizeof record;
    EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(search, &record), TAMSA_OK);
    EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(search, &record), TAMSA_E_NO_MORE_RECORDS);
    EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(search, &record), TAMSA_E_NO_MORE_RECORDS);
    Tamsa_GetObjectMetaInfoClose(search);
    query.wSize = 120;
    EXPECT_EQ(Tamsa_GetObjectMetaInfoFirst(m_database, &query, &search), TAMSA_E_INVALID_ARGUMENT);
    EXPECT_EQ(search, nullptr);
    EXPECT_EQ(Tamsa_GetObjectMetaInfoFirst(nullptr, &query, &search), TAMSA_E_INVALID_ARGUMENT);
    EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(nullptr, &record), TAMSA_E_INVALID_ARGUMENT);
    Tamsa_GetObjectMetaInfoClose(nullptr);
    Tamsa_GetObjectMetaInfoAbort(nullptr);
}

} // namespace
