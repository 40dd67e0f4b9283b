// Both searches through Request over the real store library, seeded with synthetic camera
// answers, found the way production finds it: through the machine setting "INSTALL_PATH".
#include "DelvixKeys.h"
#include "Faults.h"
#include "HostFakes.h"
#include "PluginDelvixSrv.h"
#include "ReplyRecorder.h"
#include "Tamsa.h"
#include "TamsaSeeder.h"
#include "TamsaWrapper.h"

#include <QDir>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QSettings>
#include <QTemporaryDir>

#include <gtest/gtest.h>

#include <set>
#include <unistd.h>

namespace {

int g_client = 0;

class SearchEndToEndTest : public ::testing::Test
{
protected:
    static void SetUpTestSuite()
    {
        s_data = new QTemporaryDir;
        ASSERT_TRUE(s_data->isValid());
        const QDir data(s_data->path());
        ASSERT_TRUE(data.mkpath(QStringLiteral("config")));
        QSettings::setPath(QSettings::NativeFormat, QSettings::SystemScope,
                           data.filePath(QStringLiteral("config")));
        QSettings settings(QSettings::NativeFormat, QSettings::SystemScope, QStringLiteral("Quorvex, Inc."),
                           QStringLiteral("NOVIR"));
        settings.setValue(QStringLiteral("Software/INSTALL_PATH"), QDir::toNativeSeparators(data.path()));
        settings.sync();

        s_options.objects = 4000;
        s_options.locations = 4;
        s_options.seed = 11;
        void* database = nullptr;
        const QByteArray record = TamsaWrapper::initRecord();
        Tamsa_InitDatabase(&database, record.constData(), 0);
        ASSERT_EQ(
            Tamsa_SetStoragesDBPath(database, data.filePath(QStringLiteral("Server")).toUtf8().constData()),
            0);
        const tamsa::TamsaSeedReport report = tamsa::TamsaSeeder(s_options).seed(database);
        Tamsa_ReleaseDatabase(&database);
        ASSERT_EQ(report.status, 0);
        ASSERT_EQ(report.stored, s_options.objects);
    }
    static void TearDownTestSuite()
    {
        delete s_data;
        s_data = nullptr;
    }

    void SetUp() override
    {
        // The camera directory is not what these tests are about: location n on camera-n.
        auto directory = QSharedPointer<FakeCollector>::create();
        for (uint32_t location = 1; location <= s_options.locations; ++location) {
            directory->cameras.insert(QStringLiteral("Loc%1").arg(location),
                                      QStringLiteral("camera-%1").arg(location));
        }
        plugin.setCameraInformationCollector(directory);
        plugin.InitialPluginBase(nullptr);
    }

    // The whole seeded span at `locations`, with the conditions of `params`.
    std::vector<QVariantMap> run(const QString& command, const QStringList& locations,
                                 QVariantMap params = {})
    {
        params.insert(KEY_LOC_ID_LIST, locations);
        params.insert(KEY_START_TIMESTAMP, qint64(s_options.firstTime) * 1000);
        params.insert(KEY_END_TIMESTAMP, (qint64(s_options.firstTime) + s_options.spanSeconds + 3600) * 1000);
        ReplyRecorder replies;
        RequestSenderInfo sender;
        sender.senderHandle = &g_client;
        plugin.Request(command, params, sender, replies.callback());
        EXPECT_TRUE(replies.waitFinal(60000));
        EXPECT_EQ(replies.last().code, RC_SUCCESS);
        std::vector<QVariantMap> hits;
        for (const QVariant& hit : replies.progress()) {
            hits.push_back(hit.toMap());
        }
        return hits;
    }

    static QVariantList asList(const std::vector<float>& vector)
    {
        return QVariantList(vector.begin(), vector.end());
    }

    static QTemporaryDir* s_data;
    static tamsa::TamsaSeedOptions s_options;
    PluginDelvixSrv plugin;
};

QTemporaryDir* SearchEndToEndTest::s_data = nullptr;
tamsa::TamsaSeedOptions SearchEndToEndTest::s_options;

} // namespace

TEST_F(SearchEndToEndTest, AttributeSearchReturnsTheFirst201InTimeOrder)
{
    const std::vector<QVariantMap> hits = run(CMD_START_SEARCH, {"Loc2"});
    ASSERT_EQ(hits.size(), 201u);
    qint64 previous = 0;
    std::set<qulonglong> ids;
    for (const QVariantMap& hit : hits) {
        EXPECT_EQ(hit.value(KEY_LOC_ID).toString(), "Loc2");
        EXPECT_EQ(hit.value(KEY_NODE_ID).toString(), "camera-2");
        EXPECT_GE(hit.value(KEY_START_TIMESTAMP).toLongLong(), previous);
        previous = hit.value(KEY_START_TIMESTAMP).toLongLong();
        EXPECT_FALSE(hit.value(KEY_OBJ_IMAGE).toString().isEmpty());
        // People carry their body vector as the camera sent it.
        if (hit.value(KEY_OBJ_TYPE).toString() == QStringLiteral("Human")) {
            EXPECT_EQ(hit.value(KEY_FEATURE).toList().size(), 512);
        }
        ids.insert(hit.value(KEY_OBJECT_ID).toULongLong());
    }
    EXPECT_EQ(ids.size(), 201u);
    // The earliest objects of the location, one to 201 in the camera's numbering.
    EXPECT_EQ(*ids.begin(), 1u);
    EXPECT_EQ(*ids.rbegin(), 201u);
}

TEST_F(SearchEndToEndTest, PlateSearchFindsThatVehicle)
{
    // The plate of the first vehicle seen at Loc3, from the camera answer itself.
    const tamsa::TamsaSeeder seeder(s_options);
    const QJsonArray objects = QJsonDocument::fromJson(QByteArray::fromStdString(seeder.answer(3, 0, 200)))
                                   .object()
                                   .value(QStringLiteral("ObjectMetaInfo"))
                                   .toArray();
    QString plate;
    qulonglong vehicleId = 0;
    for (const QJsonValue& object : objects) {
        if (object[QStringLiteral("ObjectType")].toString() == QStringLiteral("Vehicle")) {
            plate = object[QStringLiteral("Attributes")][QStringLiteral("PlateNumber")].toString();
            vehicleId = qulonglong(object[QStringLiteral("ID")].toDouble());
            break;
        }
    }
    ASSERT_FALSE(plate.isEmpty());
    const std::vector<QVariantMap> hits = run(CMD_START_SEARCH, {"Loc3"}, {{KEY_PLATE_NUMBER, plate}});
    ASSERT_FALSE(hits.empty());
    bool found = false;
    for (const QVariantMap& hit : hits) {
        EXPECT_EQ(hit.value(KEY_OBJ_TYPE).toString(), "Vehicle");
        EXPECT_EQ(hit.value(KEY_PLATE_NUMBER).toString(), plate);
        found = found || hit.value(KEY_OBJECT_ID).toULongLong() == vehicleId;
    }
    EXPECT_TRUE(found);
}

TEST_F(SearchEndToEndTest, ReIdFindsEverySightingOfOnePersonAndNoOneElse)
{
    const tamsa::TamsaSeeder seeder(s_options);
    const uint32_t identity = seeder.identityOf(1, 0) == 0 ? 1 : seeder.identityOf(1, 0);
    std::set<std::pair<QString, qulonglong>> expected;
    for (uint32_t location = 1; location <= s_options.locations; ++location) {
        for (uint64_t index = 0; index < seeder.objectsAt(location); ++index) {
            if (seeder.isPerson(location, index) && seeder.identityOf(location, index) == identity) {
                expected.insert({QStringLiteral("Loc%1").arg(location), qulonglong(index + 1)});
            }
        }
    }
    ASSERT_GT(expected.size(), 5u);

    const std::vector<QVariantMap> hits = run(CMD_START_REID_SEARCH, {"Loc1", "Loc2", "Loc3", "Loc4"},
                                              {{KEY_FEATURE, asList(seeder.identityBody(identity))},
                                               {KEY_FACE_FEATURE, asList(seeder.identityFace(identity))}});
    std::set<std::pair<QString, qulonglong>> found;
    for (const QVariantMap& hit : hits) {
        EXPECT_EQ(hit.value(KEY_OBJ_TYPE).toString(), "Human");
        EXPECT_TRUE(hit.value(KEY_SCORE).toFloat() >= 0.5f || hit.value(KEY_FACE_SCORE).toFloat() >= 0.5f);
        found.insert({hit.value(KEY_LOC_ID).toString(), hit.value(KEY_OBJECT_ID).toULongLong()});
    }
    EXPECT_EQ(found.size(), hits.size()); // no duplicates
    EXPECT_EQ(found, expected);
}

// The mounts stay in a second process of this program: it runs the disabled test below.
TEST(SearchEndToEndReadOnly, SearchesAnswerFromAReadOnlyStore)
{
    runDisabledTestInChild("SearchEndToEndTest.DISABLED_ReadOnlyStoreInThisProcess", 240000);
}

TEST_F(SearchEndToEndTest, DISABLED_ReadOnlyStoreInThisProcess)
{
    // The store folder becomes a read-only view of itself (chmod binds nobody when the tests run as root).
    const QByteArray store = QDir(s_data->path()).filePath(QStringLiteral("Server")).toUtf8();
    std::string reason = enterPrivateMountNamespace();
    if (reason.empty()) {
        reason = bindReadOnly(store.toStdString());
    }
    if (!reason.empty()) {
        GTEST_SKIP() << reason;
    }
    ASSERT_NE(::access((store + "/tamsa.db").constData(), W_OK), 0) << "the store is still writable";

    EXPECT_EQ(run(CMD_START_SEARCH, {"Loc2"}).size(), 201u);
    const tamsa::TamsaSeeder seeder(s_options);
    const uint32_t identity = seeder.identityOf(1, 0) == 0 ? 1 : seeder.identityOf(1, 0);
    EXPECT_FALSE(
        run(CMD_START_REID_SEARCH, {"Loc1", "Loc2"}, {{KEY_FEATURE, asList(seeder.identityBody(identity))}})
            .empty());
}
