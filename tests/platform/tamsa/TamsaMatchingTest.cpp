// Which objects a search returns, and in which order: one table over a few hand-made objects, then
// the scores of feature searches and the result record itself.
#include "StoreFixture.h"
#include "TamsaCosine.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>

#include <algorithm>
#include <functional>

using namespace storetest;

namespace {

using TamsaMatchingTest = StoreFixture;
using Q = QueryOptions;

TEST_F(TamsaMatchingTest, QueriesSelectAndOrderTheRightObjects)
{
    // The walker crosses x = 0.5 from the positive side, entering the zone only between points; the
    // returner stays long and crosses the other way above the zone; the van's plate is known only
    // from its plate crop, and it passes beyond the line's end.
    const std::string adult = R"({"Age":"Adult","Gender":1,"UpperColor":[2,5],"Accessories":[]})";
    ObjectSpec loiterer{5}; // 11 points over 10 s, points 2..7 inside the zone: a stay of 5 s
    for (int i = 0; i <= 10; ++i) {
        loiterer.trajectory.push_back({i >= 2 && i <= 7 ? 0.55 : 0.7, 0.5});
    }
    ASSERT_EQ(
        put(1, {{1, "Human", 100, 200, adult, {{0.1, 0.5}, {0.3, 0.5}, {0.9, 0.5}}},
                {2, "Human", 5000, 9000, R"({"Gender":0})", {{0.9, 0.7}, {0.2, 0.7}}},
                {3, "Vehicle", 300, 310, R"({"Type":3,"PlateNumber":"ABC-1234"})", {{0.1, 0.1}, {0.4, 0.9}}},
                {4, "Vehicle", 400, 410, "{}", {{0.1, 1.5}, {0.9, 1.5}}, {}, {}, false, "xyz 999"},
                loiterer}),
        5);
    ASSERT_EQ(put(3, {{6, "Human", 150, 160}}), 1);

    const std::string line = "[[0.5,0],[0.5,1]]";
    const std::string zone = R"([{"x":0.4,"y":0.4},{"x":0.6,"y":0.4},{"x":0.6,"y":0.6},{"x":0.4,"y":0.6}])";
    struct Case
    {
        const char* name;
        std::function<void(Q&)> edit;
        Ids expected; // in this order, unless the query asks for no sorting
        int32_t status = TAMSA_E_NO_MORE_RECORDS;
    };
    // clang-format off
    const Case cases[] = {
        {"all, by start time", [](Q&) {}, {1, 3, 4, 5, 2}},
        {"descending", [](Q& q) { q.descending = true; }, {2, 5, 4, 3, 1}},
        {"unsorted", [](Q& q) { q.doNotSort = q.descending = true; }, {1, 2, 3, 4, 5}},
        {"window from an end", [](Q& q) { q.start = 200, q.end = 300; }, {1, 3}},
        {"window up to a start", [](Q& q) { q.start = 50, q.end = 100; }, {1}},
        {"window inside a stay", [](Q& q) { q.start = 6000, q.end = 6001; }, {2}},
        {"inverted window", [](Q& q) { q.start = 300, q.end = 100; }, {}},
        {"other location", [](Q& q) { q.locations = {3}; }, {6}},
        {"locations merged, repeats once", [](Q& q) { q.locations = {1, 3, 1}; }, {1, 6, 3, 4, 5, 2}},
        {"no location list", [](Q& q) { q.nullLocations = true; }, {}},
        {"type", [](Q& q) { q.type = "Vehicle"; }, {3, 4}},
        {"lists share a value", [](Q& q) { q.primary = R"({"UpperColor":[5,7]})"; }, {1}},
        {"scalar in a list", [](Q& q) { q.primary = R"({"UpperColor":2})"; }, {1}},
        {"list holds the scalar", [](Q& q) { q.primary = R"({"Gender":[0,1]})"; }, {1, 2}},
        {"list misses the scalar", [](Q& q) { q.primary = R"({"Gender":[3,2]})"; }, {}},
        {"numbers by value", [](Q& q) { q.primary = R"({"Gender":1.0})"; }, {1}},
        {"a text is no number", [](Q& q) { q.primary = R"({"Gender":"1"})"; }, {}},
        {"texts ignore case", [](Q& q) { q.primary = R"({"Age":"aDULT"})"; }, {1}},
        {"missing attribute", [](Q& q) { q.primary = R"({"Hat":1})"; }, {}},
        {"empty list", [](Q& q) { q.primary = R"({"Accessories":[]})"; }, {}},
        {"primary and other", [](Q& q) { q.primary = R"({"Gender":1})", q.other = R"({"UpperColor":[5]})"; }, {1}},
        {"empty conditions", [](Q& q) { q.primary = q.other = "{}"; }, {1, 3, 4, 5, 2}},
        {"attributes not an object", [](Q& q) { q.primary = "[1]"; }, {}, TAMSA_E_BAD_QUERY},
        {"plate contained", [](Q& q) { q.plate = "c-12"; }, {3}},
        {"plate star", [](Q& q) { q.plate = "a*4"; }, {3}},
        {"plate question mark", [](Q& q) { q.plate = "A?C"; }, {3}},
        {"plate from the crop", [](Q& q) { q.plate = "Z 99"; }, {4}},
        {"any plate", [](Q& q) { q.plate = "*"; }, {3, 4}},
        {"plate attribute", [](Q& q) { q.primary = R"({"PlateNumber":"*99"})"; }, {4}},
        {"plate and type", [](Q& q) { q.primary = R"({"PlateNumber":"bc-1","Type":3})"; }, {3}},
        {"line either way", [&](Q& q) { q.trace = line; }, {1, 2}},
        {"line positive to negative", [&](Q& q) { q.trace = line, q.direction = 2; }, {1}},
        {"line negative to positive", [&](Q& q) { q.trace = line, q.direction = 1; }, {2}},
        {"unknown direction", [&](Q& q) { q.trace = line, q.direction = 5; }, {}, TAMSA_E_BAD_QUERY},
        {"one-point trace", [](Q& q) { q.trace = "[[0.5,0.5]]"; }, {}, TAMSA_E_BAD_QUERY},
        {"endless point", [](Q& q) { q.trace = "[[1e999,0],[0.5,1]]"; }, {}, TAMSA_E_BAD_QUERY},
        {"feature cut short", [](Q& q) { q.feature = "[1,2"; }, {}, TAMSA_E_BAD_QUERY},
        {"zone entered", [&](Q& q) { q.trace = zone; }, {1, 5}},
        {"loitering long enough", [&](Q& q) { q.trace = zone, q.loitering = true, q.duration = 5; }, {5}},
        {"loitering too short", [&](Q& q) { q.trace = zone, q.loitering = true, q.duration = 6; }, {}},
    };
    // clang-format on
    for (const Case& c : cases) {
        Q options;
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

// "id:score:faceScore " per result, scores to four places.
std::string scored(const std::vector<ResultCopy>& results)
{
    std::string text;
    for (const ResultCopy& r : results) {
        text += QString::asprintf("%llu:%.4f:%.4f ", qulonglong(r.id), r.score, r.faceScore).toStdString();
    }
    return text;
}

TEST_F(TamsaMatchingTest, FeatureScoresThresholdAndOrder)
{
    const std::vector<float> identity = randomUnitVector(1), faceIdentity = randomUnitVector(2);
    const std::vector<float> closeBody = noisyCopy(identity, 0.3f, 10),
                             fartherBody = noisyCopy(identity, 1.0f, 11);
    // The fourth has a stranger's body with the identity's face.
    const std::vector<float> body4 = randomUnitVector(14), face4 = noisyCopy(faceIdentity, 0.2f, 15);
    ASSERT_EQ(put(1, {{1, "Human", 1000, 1010, "{}", {}, closeBody},
                      {2, "Human", 1000, 1010, "{}", {}, fartherBody},
                      {3, "Human", 1000, 1010, "{}", {}, randomUnitVector(12), randomUnitVector(13)},
                      {4, "Human", 1000, 1010, "{}", {}, body4, face4},
                      {5, "Vehicle"}}),
              5);
    // Best first, strangers below the threshold left out; with a face vector the better of the two
    // scores orders, and both are filled.
    Q options;
    options.feature = jsonArray(identity);
    EXPECT_EQ(scored(search(options)),
              scored({{1, 0, "", "", 0, 0, {}, "", plainCosine(identity, closeBody)},
                      {2, 0, "", "", 0, 0, {}, "", plainCosine(identity, fartherBody)}}));
    options.faceFeature = jsonArray(faceIdentity);
    const std::vector<ResultCopy> both = search(options);
    ASSERT_EQ(idsOf(both).size(), 3u);
    EXPECT_EQ(
        scored({both[0]}),
        scored(
            {{4, 0, "", "", 0, 0, {}, "", plainCosine(identity, body4), plainCosine(faceIdentity, face4)}}));
    EXPECT_GE(std::max(both[1].score, both[1].faceScore), std::max(both[2].score, both[2].faceScore));
    options.doNotSort = true;
    Ids unsorted = idsOf(search(options));
    std::sort(unsorted.begin(), unsorted.end());
    EXPECT_EQ(unsorted, (Ids{1, 2, 4}));

    options.start = 2000; // time still applies to feature searches
    EXPECT_TRUE(search(options).empty());

    // The vector kernel in use and the plain loop agree, also on lengths that leave a tail.
    for (size_t n : {kDim, kDim - 5, size_t(3)}) {
        float parts[4] = {};
        tamsa::dotNormScalar()(identity.data(), closeBody.data(), n, &parts[0], &parts[1]);
        tamsa::dotNormBest()(identity.data(), closeBody.data(), n, &parts[2], &parts[3]);
        EXPECT_NEAR(parts[0], parts[2], 1e-5) << tamsa::dotNormBestName() << " n=" << n;
        EXPECT_NEAR(parts[1], parts[3], 1e-4) << tamsa::dotNormBestName() << " n=" << n;
    }
}

std::vector<float> floatsOf(const QJsonValue& array)
{
    std::vector<float> values;
    for (const QJsonValue& value : array.toArray()) {
        values.push_back(float(value.toDouble()));
    }
    return values;
}

TEST_F(TamsaMatchingTest, ResultRecordCarriesEverythingStoredAndEndsCleanly)
{
    ObjectSpec person{18446744073709551615ull,
                      "Human",
                      1000,
                      1010,
                      R"({"Age":"Adult","Gender":1,"UpperColor":[2,5],"Name":"\ud800\udc00 \u00e9"})",
                      {{0.25, 0.5}, {0.75, 0.125}},
                      randomUnitVector(3),
                      randomUnitVector(4),
                      true};
    ASSERT_EQ(put(9, {person}), 1);
    Q options;
    options.locations = {9};
    const std::vector<ResultCopy> results = search(options);
    ASSERT_EQ(results.size(), 1u);
    const ResultCopy& r = results[0];
    EXPECT_EQ(
        QString::asprintf("%llu %u %s %u-%u", qulonglong(r.id), r.location, r.type.c_str(), r.start, r.end),
        "18446744073709551615 9 Human 1000-1010");
    EXPECT_EQ(r.trajectory, (std::vector<double>{0.25, 0.5, 0.75, 0.125}));
    const auto json = [](const std::string& text) {
        return QJsonDocument::fromJson(QByteArray::fromStdString(text));
    };
    EXPECT_EQ(json(r.attributes), json(person.attributes));
    const QJsonObject body = json(r.thumbnails)["Thumbnail"][0].toObject();
    const QJsonObject face = json(r.thumbnails)["FaceThumbnail"][0].toObject();
    EXPECT_EQ(body["image"].toString(), "aW1hZ2U" + QString::number(person.id));
    EXPECT_EQ(face["face_detection_info"]["filtered"].toInt(), 1);
    EXPECT_EQ(floatsOf(body["feature"]), person.body);
    EXPECT_EQ(floatsOf(face["feature"]), person.face);

    std::vector<uint32_t> locations;
    TTAMSA_OBJECTMETAINFO_QUERY query = makeQuery(options, &locations);
    query.wSize = 120;
    void* search = &query;
    EXPECT_EQ(Tamsa_GetObjectMetaInfoFirst(m_database, &query, &search), TAMSA_E_INVALID_ARGUMENT);
    EXPECT_EQ(search, nullptr);
}

} // namespace
