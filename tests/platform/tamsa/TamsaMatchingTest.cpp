// Which objects a search returns, and in which order: one case per matching rule.
#include "TamsaTestStore.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>

using namespace tamsatest;

namespace {

using Ids = std::vector<uint64_t>;

class TamsaMatchingTest : public TamsaStoreFixture
{};

TEST_F(TamsaMatchingTest, TimeWindowOverlapsAtBothEdges)
{
    ObjectSpec object;
    object.start = 100;
    object.end = 200;
    ObjectSpec longStay;
    longStay.id = 2;
    longStay.start = 5000;
    longStay.end = 9000;
    ASSERT_EQ(put(1, {object, longStay}), 2);
    auto window = [this](uint32_t start, uint32_t end) {
        QueryOptions options;
        options.start = start;
        options.end = end;
        return searchIds(options);
    };
    EXPECT_EQ(window(200, 300), Ids{1}) << "window starting at the object's end";
    EXPECT_EQ(window(50, 100), Ids{1}) << "window ending at the object's start";
    EXPECT_EQ(window(201, 300), Ids{});
    EXPECT_EQ(window(0, 99), Ids{});
    EXPECT_EQ(window(120, 130), Ids{1}) << "window inside the object";
    EXPECT_EQ(window(6000, 6001), Ids{2}) << "window inside a long stay";
    EXPECT_EQ(window(300, 100), Ids{}) << "inverted window";
}

TEST_F(TamsaMatchingTest, LocationListSelectsAndEmptyListMatchesNothing)
{
    ASSERT_EQ(put(1, {ObjectSpec{}}), 1);
    ObjectSpec other;
    other.id = 2;
    ASSERT_EQ(put(3, {other}), 1);
    QueryOptions options;
    options.locations = {3};
    EXPECT_EQ(searchIds(options), Ids{2});
    options.locations = {1, 3, 1};
    EXPECT_EQ(searchIds(options).size(), 2u) << "a repeated location yields its objects once";
    options.locations = {};
    EXPECT_EQ(searchIds(options), Ids{});
    options.nullLocations = true;
    EXPECT_EQ(searchIds(options), Ids{});
}

TEST_F(TamsaMatchingTest, ObjectTypeMustBeEqual)
{
    ObjectSpec car;
    car.id = 2;
    car.type = "Vehicle";
    ASSERT_EQ(put(1, {ObjectSpec{}, car}), 2);
    QueryOptions options;
    options.type = "Vehicle";
    EXPECT_EQ(searchIds(options), Ids{2});
    options.type = "Human";
    EXPECT_EQ(searchIds(options), Ids{1});
}

TEST_F(TamsaMatchingTest, AttributeListsScalarsNumbersAndTexts)
{
    ObjectSpec person;
    person.attributes = R"({"Age":"Adult","Gender":1,"UpperColor":[2,5],"Accessories":[]})";
    ASSERT_EQ(put(1, {person}), 1);
    auto matches = [this](const std::string& primary, const std::string& other) {
        QueryOptions options;
        options.primary = primary;
        options.other = other;
        return searchIds(options) == Ids{1};
    };
    EXPECT_TRUE(matches(R"({"UpperColor":[5,7]})", "")) << "list shares a value with a list";
    EXPECT_FALSE(matches(R"({"UpperColor":[7,8]})", ""));
    EXPECT_TRUE(matches(R"({"UpperColor":2})", "")) << "scalar found in a list";
    EXPECT_TRUE(matches(R"({"Gender":[0,1]})", "")) << "list holding the scalar";
    EXPECT_FALSE(matches(R"({"Gender":[0,2]})", ""));
    EXPECT_TRUE(matches(R"({"Gender":1.0})", "")) << "numbers compare numerically";
    EXPECT_FALSE(matches(R"({"Gender":"1"})", "")) << "a text is not a number";
    EXPECT_TRUE(matches(R"({"Age":"aDULT"})", "")) << "texts compare case-insensitively";
    EXPECT_FALSE(matches(R"({"Age":"Child"})", ""));
    EXPECT_FALSE(matches(R"({"Hat":1})", "")) << "a missing attribute does not match";
    EXPECT_FALSE(matches(R"({"Accessories":[]})", "")) << "an empty list shares nothing";
    EXPECT_TRUE(matches(R"({"Gender":1})", R"({"UpperColor":[5]})")) << "primary and other both hold";
    EXPECT_FALSE(matches(R"({"Gender":1})", R"({"UpperColor":[9]})"));
    EXPECT_TRUE(matches("{}", "{}"));
}

TEST_F(TamsaMatchingTest, PlatesMatchContainedTextWithWildcards)
{
    ObjectSpec first;
    first.type = "Vehicle";
    first.attributes = R"({"Type":3,"PlateNumber":"ABC-1234"})";
    ObjectSpec second;
    second.id = 2;
    second.type = "Vehicle";
    second.plateCrop = "xyz 999"; // plate known only from the plate crop
    ObjectSpec person;
    person.id = 3;
    ASSERT_EQ(put(1, {first, second, person}), 3);
    auto plate = [this](const std::string& pattern) {
        QueryOptions options;
        options.plate = pattern;
        return searchIds(options);
    };
    EXPECT_EQ(plate("c-12"), Ids{1}) << "contained, case-insensitive";
    EXPECT_EQ(plate("a*4"), Ids{1});
    EXPECT_EQ(plate("A?C"), Ids{1});
    EXPECT_EQ(plate("A?B"), Ids{});
    EXPECT_EQ(plate("Z 99"), Ids{2});
    EXPECT_EQ(plate("*"), (Ids{1, 2})) << "only objects with a plate";
    QueryOptions options;
    options.primary = R"({"PlateNumber":"*99"})";
    EXPECT_EQ(searchIds(options), Ids{2}) << "the PlateNumber attribute condition uses the same rule";
    options.primary = R"({"PlateNumber":"bc-1","Type":3})";
    EXPECT_EQ(searchIds(options), Ids{1});
}

TEST_F(TamsaMatchingTest, LineIsCrossedInTheRequestedDirection)
{
    ObjectSpec rightToLeft; // positive side of the line below first, then negative
    rightToLeft.trajectory = {{0.1, 0.5}, {0.3, 0.5}, {0.9, 0.5}};
    ObjectSpec leftToRight;
    leftToRight.id = 2;
    leftToRight.trajectory = {{0.9, 0.6}, {0.2, 0.6}};
    ObjectSpec stays;
    stays.id = 3;
    stays.trajectory = {{0.1, 0.1}, {0.4, 0.9}};
    ObjectSpec passesBeyondTheEnd;
    passesBeyondTheEnd.id = 4;
    passesBeyondTheEnd.trajectory = {{0.1, 1.5}, {0.9, 1.5}};
    ASSERT_EQ(put(1, {rightToLeft, leftToRight, stays, passesBeyondTheEnd}), 4);
    QueryOptions options;
    options.trace = "[[0.5,0],[0.5,1]]";
    options.direction = 0;
    EXPECT_EQ(searchIds(options), (Ids{1, 2}));
    options.direction = 2; // positive to negative
    EXPECT_EQ(searchIds(options), Ids{1});
    options.direction = 1;
    EXPECT_EQ(searchIds(options), Ids{2});
    options.direction = 5;
    int32_t status = 0;
    search(options, &status);
    EXPECT_EQ(status, TAMSA_E_BAD_QUERY);
}

TEST_F(TamsaMatchingTest, ZoneIsEntered)
{
    ObjectSpec through;
    through.trajectory = {{0.1, 0.5}, {0.5, 0.5}, {0.9, 0.5}};
    ObjectSpec outside;
    outside.id = 2;
    outside.trajectory = {{0.1, 0.1}, {0.2, 0.2}};
    ObjectSpec jumpsAcross; // no point inside, one segment through the zone
    jumpsAcross.id = 3;
    jumpsAcross.trajectory = {{0.5, 0.1}, {0.5, 0.9}};
    ObjectSpec noTrajectory;
    noTrajectory.id = 4;
    ASSERT_EQ(put(1, {through, outside, jumpsAcross, noTrajectory}), 4);
    QueryOptions options;
    options.trace = R"([{"x":0.4,"y":0.4},{"x":0.6,"y":0.4},{"x":0.6,"y":0.6},{"x":0.4,"y":0.6}])";
    EXPECT_EQ(searchIds(options), (Ids{1, 3}));
}

TEST_F(TamsaMatchingTest, LoiteringNeedsTheDurationInside)
{
    ObjectSpec loiterer; // 11 points over 10 s: points 2..7 inside, a stay of 5 s
    loiterer.start = 1000;
    loiterer.end = 1010;
    for (int i = 0; i <= 10; ++i) {
        const bool inside = i >= 2 && i <= 7;
        loiterer.trajectory.push_back({inside ? 0.5 : 0.1, 0.5});
    }
    ASSERT_EQ(put(1, {loiterer}), 1);
    QueryOptions options;
    options.trace = "[[0.4,0.4],[0.6,0.4],[0.6,0.6],[0.4,0.6]]";
    options.loitering = true;
    options.duration = 5;
    EXPECT_EQ(searchIds(options), Ids{1});
    options.duration = 6;
    EXPECT_EQ(searchIds(options), Ids{});
    options.loitering = false; // plain entry ignores the duration
    EXPECT_EQ(searchIds(options), Ids{1});
}

TEST_F(TamsaMatchingTest, StartTimeOrderAcrossLocations)
{
    std::vector<ObjectSpec> east, west;
    for (uint32_t i = 0; i < 5; ++i) {
        ObjectSpec object;
        object.id = 10 + i;
        object.start = 100 + 20 * i;
        object.end = object.start + 5;
        east.push_back(object);
        object.id = 20 + i;
        object.start = 110 + 20 * i;
        object.end = object.start + 5;
        west.push_back(object);
    }
    ASSERT_EQ(put(1, east), 5);
    ASSERT_EQ(put(2, west), 5);
    QueryOptions options;
    options.locations = {2, 1};
    EXPECT_EQ(searchIds(options), (Ids{10, 20, 11, 21, 12, 22, 13, 23, 14, 24}));
    options.descending = true;
    EXPECT_EQ(searchIds(options), (Ids{24, 14, 23, 13, 22, 12, 21, 11, 20, 10}));
    options.doNotSort = true;
    Ids unsorted = searchIds(options);
    std::sort(unsorted.begin(), unsorted.end());
    EXPECT_EQ(unsorted, (Ids{10, 11, 12, 13, 14, 20, 21, 22, 23, 24}));
}

TEST_F(TamsaMatchingTest, FeatureScoresThresholdAndOrder)
{
    const std::vector<float> identity = randomUnitVector(1);
    const std::vector<float> faceIdentity = randomUnitVector(2);
    ObjectSpec close;
    close.body = noisyCopy(identity, 0.3f, 10);
    ObjectSpec farther;
    farther.id = 2;
    farther.body = noisyCopy(identity, 1.0f, 11);
    ObjectSpec stranger;
    stranger.id = 3;
    stranger.body = randomUnitVector(12);
    stranger.face = randomUnitVector(13);
    ObjectSpec faceOnly; // a stranger's body, the identity's face
    faceOnly.id = 4;
    faceOnly.body = randomUnitVector(14);
    faceOnly.face = noisyCopy(faceIdentity, 0.2f, 15);
    ObjectSpec vehicle;
    vehicle.id = 5;
    vehicle.type = "Vehicle";
    ASSERT_EQ(put(1, {close, farther, stranger, faceOnly, vehicle}), 5);

    QueryOptions options;
    options.feature = jsonArray(identity);
    std::vector<ResultCopy> results = search(options);
    ASSERT_EQ(results.size(), 2u);
    EXPECT_EQ(results[0].id, 1u);
    EXPECT_EQ(results[1].id, 2u);
    EXPECT_NEAR(results[0].score, plainCosine(identity, close.body), 1e-5);
    EXPECT_NEAR(results[1].score, plainCosine(identity, farther.body), 1e-5);
    EXPECT_GE(results[1].score, 0.5f);
    EXPECT_EQ(results[0].faceScore, 0.0f) << "no face vector in the query";

    options.faceFeature = jsonArray(faceIdentity);
    results = search(options);
    ASSERT_EQ(results.size(), 3u);
    EXPECT_EQ(results[0].id, 4u) << "the face score is the best of all";
    EXPECT_NEAR(results[0].faceScore, plainCosine(faceIdentity, faceOnly.face), 1e-5);
    EXPECT_NEAR(results[0].score, plainCosine(identity, faceOnly.body), 1e-5)
        << "the other score is filled too";
    EXPECT_LT(results[0].score, 0.5f);
    for (size_t i = 1; i < results.size(); ++i) {
        EXPECT_GE(std::max(results[i - 1].score, results[i - 1].faceScore),
                  std::max(results[i].score, results[i].faceScore));
    }

    options.doNotSort = true;
    Ids unsorted;
    for (const ResultCopy& result : search(options)) {
        unsorted.push_back(result.id);
    }
    std::sort(unsorted.begin(), unsorted.end());
    EXPECT_EQ(unsorted, (Ids{1, 2, 4}));

    options = QueryOptions();
    options.feature = jsonArray(identity);
    options.start = 2000; // time still applies to feature searches
    EXPECT_TRUE(search(options).empty());
    options = QueryOptions();
    options.feature = "[1,2";
    int32_t status = 0;
    search(options, &status);
    EXPECT_EQ(status, TAMSA_E_BAD_QUERY);
}

TEST_F(TamsaMatchingTest, ResultRecordCarriesTextsTrajectoryAndVectors)
{
    ObjectSpec person;
    person.id = 18446744073709551615ull;
    person.attributes = R"({"Age":"Adult","Gender":1,"UpperColor":[2,5]})";
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
    const QJsonObject attributes =
        QJsonDocument::fromJson(QByteArray::fromStdString(result.attributes)).object();
    EXPECT_EQ(attributes.value("Age").toString(), "Adult");
    EXPECT_EQ(attributes.value("UpperColor").toArray(), (QJsonArray{2, 5}));

    const QJsonObject thumbnails =
        QJsonDocument::fromJson(QByteArray::fromStdString(result.thumbnails)).object();
    const QJsonObject body = thumbnails.value("Thumbnail").toArray().at(0).toObject();
    EXPECT_FALSE(body.value("image").toString().isEmpty());
    const QJsonArray bodyFeature = body.value("feature").toArray();
    ASSERT_EQ(bodyFeature.size(), qsizetype(kDim));
    const QJsonObject face = thumbnails.value("FaceThumbnail").toArray().at(0).toObject();
    EXPECT_EQ(face.value("face_detection_info").toObject().value("filtered").toInt(), 1);
    const QJsonArray faceFeature = face.value("feature").toArray();
    ASSERT_EQ(faceFeature.size(), qsizetype(kDim));
    for (size_t i = 0; i < kDim; ++i) {
        ASSERT_EQ(float(bodyFeature.at(qsizetype(i)).toDouble()), person.body[i]) << i;
        ASSERT_EQ(float(faceFeature.at(qsizetype(i)).toDouble()), person.face[i]) << i;
    }
}

TEST_F(TamsaMatchingTest, EndCodeAfterTheLastRecordAndArgumentErrors)
{
    ASSERT_EQ(put(1, {ObjectSpec{}}), 1);
    QueryOptions options;
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
    query.wSize = sizeof query;
    query.pszTrace = "[[0.5,0.5]]";
    EXPECT_EQ(Tamsa_GetObjectMetaInfoFirst(m_database, &query, &search), TAMSA_E_BAD_QUERY);
    query.pszTrace = nullptr;
    query.pszPrimaryAttributes = "[1]";
    EXPECT_EQ(Tamsa_GetObjectMetaInfoFirst(m_database, &query, &search), TAMSA_E_BAD_QUERY);
    EXPECT_EQ(Tamsa_GetObjectMetaInfoFirst(nullptr, &query, &search), TAMSA_E_INVALID_ARGUMENT);
    EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(nullptr, &record), TAMSA_E_INVALID_ARGUMENT);
    Tamsa_GetObjectMetaInfoClose(nullptr);
    Tamsa_GetObjectMetaInfoAbort(nullptr);
}

} // namespace
