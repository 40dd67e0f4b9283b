// Re-identification through Request over the real store library, seeded with synthetic camera
// answers, found the way production finds it: through the machine setting "INSTALL_PATH", where
// the 32-bit installer's key is read before the 64-bit one's. (The attribute search through
// Request runs over a real store in SearchTest.)
#include "DelvixKeys.h"
#include "HostFakes.h"
#include "PluginDelvixSrv.h"
#include "ReplyRecorder.h"
#include "Tamsa.h"
#include "TamsaSeeder.h"
#include "TamsaWrapper.h"

#include <QDir>
#include <QSettings>
#include <QTemporaryDir>
#include <gtest/gtest.h>

#include <set>

namespace {

int g_client = 0;
QTemporaryDir* g_data = nullptr;
tamsa::TamsaSeedOptions g_options{4000, 4, 11};
QString g_seedFailure; // why the suite's store could not be seeded; empty when it was

const auto list = [](const std::vector<float>& vector) { return QVariantList(vector.begin(), vector.end()); };

// "location/ID/camera" of each hit.
std::set<QString> sightings(const std::vector<QVariantMap>& hits)
{
    std::set<QString> found;
    for (const QVariantMap& hit : hits) {
        found.insert(QStringList{hit.value(KEY_LOC_ID).toString(), hit.value(KEY_OBJECT_ID).toString(),
                                 hit.value(KEY_NODE_ID).toString()}
                         .join('/'));
    }
    return found;
}

class SearchEndToEndTest : public ::testing::Test
{
protected:
    // Seeds once for the suite. A failure here is kept and reported by every test's SetUp: a
    // failed assertion in the suite's own set-up would only mark its tests skipped.
    static void SetUpTestSuite()
    {
        g_data = new QTemporaryDir;
        const QDir data(g_data->path());
        QSettings::setPath(QSettings::NativeFormat, QSettings::SystemScope, data.filePath("config"));
        QSettings settings(QSettings::NativeFormat, QSettings::SystemScope, "Quorvex, Inc.", "NOVIR");
        settings.setValue("Software/WOW6432node/INSTALL_PATH", QDir::toNativeSeparators(data.path()));
        settings.setValue("Software/INSTALL_PATH", "/nonexistent");
        settings.sync();
        void* database = nullptr;
        Tamsa_InitDatabase(&database, TamsaWrapper::initRecord().constData(), 0);
        const int pathStatus =
            Tamsa_SetStoragesDBPath(database, data.filePath("Server").toUtf8().constData());
        const tamsa::TamsaSeedReport report = tamsa::TamsaSeeder(g_options).seed(database);
        Tamsa_ReleaseDatabase(&database);
        if (pathStatus != 0 || report.status != 0 || report.stored != g_options.objects) {
            g_seedFailure = QString("path %1, status %2, %3 stored")
                                .arg(pathStatus)
                                .arg(report.status)
                                .arg(report.stored);
        }
    }
    static void TearDownTestSuite() { delete g_data; }

    void SetUp() override
    {
        ASSERT_TRUE(g_seedFailure.isEmpty()) << qPrintable(g_seedFailure);
        // The camera directory is not what these tests are about: location n on camera-n.
        auto directory = QSharedPointer<FakeCollector>::create();
        for (uint32_t location = 1; location <= g_options.locations; ++location) {
            directory->cameras.insert(QString("Loc%1").arg(location), QString("camera-%1").arg(location));
        }
        plugin.setCameraInformationCollector(directory);
        plugin.InitialPluginBase(nullptr);
    }

    // The whole seeded span at `locations`, with the conditions of `params`.
    std::vector<QVariantMap> run(const QString& command, const QStringList& locations,
                                 QVariantMap params = {})
    {
        params.insert(KEY_LOC_ID_LIST, locations);
        params.insert(KEY_START_TIMESTAMP, qint64(g_options.firstTime) * 1000);
        params.insert(KEY_END_TIMESTAMP, (qint64(g_options.firstTime) + g_options.spanSeconds + 3600) * 1000);
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

    const tamsa::TamsaSeeder seeder{g_options};
    const uint32_t identity = std::max(1u, seeder.identityOf(1, 0)); // a person seen at Loc1
    PluginDelvixSrv plugin;
};

} // namespace

TEST_F(SearchEndToEndTest, ReIdFindsEverySightingOfOnePersonAndNoOneElse)
{
    std::set<QString> expected;
    for (uint32_t location = 1; location <= g_options.locations; ++location) {
        for (uint64_t index = 0; index < seeder.objectsAt(location); ++index) {
            if (seeder.isPerson(location, index) && seeder.identityOf(location, index) == identity) {
                expected.insert(QString("Loc%1/%2/camera-%1").arg(location).arg(index + 1));
            }
        }
    }
    ASSERT_GT(expected.size(), 5u);
    const std::vector<QVariantMap> hits = run(CMD_START_REID_SEARCH, {"Loc1", "Loc2", "Loc3", "Loc4"},
                                              {{KEY_FEATURE, list(seeder.identityBody(identity))},
                                               {KEY_FACE_FEATURE, list(seeder.identityFace(identity))}});
    EXPECT_EQ(sightings(hits).size(), hits.size()); // no duplicates
    EXPECT_EQ(sightings(hits), expected);
}
