// The synthetic camera answers: valid for the store, deterministic, and with identities that a
// feature search can tell apart.
#include "TamsaSeeder.h"
#include "TamsaTestStore.h"

#include <QByteArray>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>

#include <set>

using namespace tamsatest;

namespace {

class TamsaSeederTest : public TamsaStoreFixture
{};

TEST_F(TamsaSeederTest, AnswersAreDeterministicAndComplete)
{
    tamsa::TamsaSeedOptions options;
    options.objects = 600;
    options.locations = 3;
    options.seed = 4;
    options.batchSize = 70;
    const tamsa::TamsaSeeder seeder(options);
    EXPECT_EQ(seeder.answer(2, 10, 5), tamsa::TamsaSeeder(options).answer(2, 10, 5));
    EXPECT_NE(seeder.answer(2, 10, 5), seeder.answer(3, 10, 5));

    const QJsonObject answer =
        QJsonDocument::fromJson(QByteArray::fromStdString(seeder.answer(1, 0, 50))).object();
    const QJsonArray objects = answer.value("ObjectMetaInfo").toArray();
    ASSERT_EQ(objects.size(), 50);
    int people = 0;
    for (const QJsonValue& value : objects) {
        const QJsonObject object = value.toObject();
        const QByteArray image = QByteArray::fromBase64(
            object.value("Thumbnail").toArray().at(0).toObject().value("image").toString().toLatin1());
        EXPECT_TRUE(image.startsWith("\x89PNG\r\n\x1a\n")) << "a real PNG thumbnail";
        if (object.value("ObjectType").toString() == "Human") {
            ++people;
            EXPECT_EQ(object.value("Thumbnail").toArray().at(0).toObject().value("feature").toArray().size(),
                      512);
        } else {
            EXPECT_FALSE(object.value("Attributes").toObject().value("PlateNumber").toString().isEmpty());
        }
    }
    EXPECT_GT(people, 20);

    const tamsa::TamsaSeedReport report = seeder.seed(m_database);
    EXPECT_EQ(report.status, 0);
    EXPECT_EQ(report.stored, 600u);
    EXPECT_EQ(report.people + report.vehicles, 600u);
    QueryOptions all;
    all.locations = {1, 2, 3};
    EXPECT_EQ(searchIds(all).size(), 600u);
}

TEST_F(TamsaSeederTest, SightingsOfOneIdentityAreFoundAndOthersAreNot)
{
    tamsa::TamsaSeedOptions options;
    options.objects = 2000;
    options.locations = 4;
    const tamsa::TamsaSeeder seeder(options);
    ASSERT_EQ(seeder.seed(m_database).stored, 2000u);

    const uint32_t identity = 3;
    size_t expected = 0;
    for (uint32_t location = 1; location <= options.locations; ++location) {
        for (uint64_t index = 0; index < seeder.objectsAt(location); ++index) {
            expected += seeder.isPerson(location, index) && seeder.identityOf(location, index) == identity;
        }
    }
    ASSERT_GT(expected, 3u);
    QueryOptions query;
    query.locations = {1, 2, 3, 4};
    query.feature = jsonArray(seeder.identityBody(identity));
    const std::vector<ResultCopy> hits = search(query);
    EXPECT_EQ(hits.size(), expected) << "every sighting and nobody else";
    std::set<uint32_t> locations;
    std::vector<std::vector<float>> sightings;
    for (const ResultCopy& hit : hits) {
        EXPECT_GT(hit.score, 0.8f);
        locations.insert(hit.location);
        const QJsonObject thumbnails =
            QJsonDocument::fromJson(QByteArray::fromStdString(hit.thumbnails)).object();
        const QJsonArray feature =
            thumbnails.value("Thumbnail").toArray().at(0).toObject().value("feature").toArray();
        sightings.emplace_back();
        for (const QJsonValue& number : feature) {
            sightings.back().push_back(float(number.toDouble()));
        }
    }
    EXPECT_GT(locations.size(), 1u) << "identities reappear across locations";
    // Two sightings of one identity resemble each other as well (about 0.74), strangers do not.
    ASSERT_GE(sightings.size(), 2u);
    EXPECT_GT(plainCosine(sightings[0], sightings[1]), 0.7f);
    EXPECT_LT(plainCosine(seeder.identityBody(identity), seeder.identityBody(identity + 1)), 0.3f);
}

} // namespace
