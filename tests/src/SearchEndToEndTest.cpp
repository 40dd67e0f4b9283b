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

TEST(SearchEndToEndTest, ReIdFindsEverySightingOfOnePersonAndNoOneElse)
{
    QTemporaryDir data;
    const tamsa::TamsaSeedOptions options{4000, 4, 11};
    QSettings::setPath(QSettings::NativeFormat, QSettings::SystemScope, data.filePath("config"));
    QSettings settings(QSettings::NativeFormat, QSettings::SystemScope, "Quorvex, Inc.", "NOVIR");
    settings.setValue("Software/WOW6432node/INSTALL_PATH", QDir::toNativeSeparators(data.path()));
    settings.setValue("Software/INSTALL_PATH", "/nonexistent");
    settings.sync();
    void* database = nullptr;
    Tamsa_InitDatabase(&database, TamsaWrapper::initRecord().constData(), 0);
    ASSERT_EQ(Tamsa_SetStoragesDBPath(database, data.filePath("Server").toUtf8().constData()), 0);
    const tamsa::TamsaSeeder seeder(options);
    const tamsa::TamsaSeedReport report = seeder.seed(database);
    Tamsa_ReleaseDatabase(&database);
    ASSERT_TRUE(report.status == 0 && report.stored == options.objects)
        << report.status << " " << report.stored;

    // The camera directory is not what this is about: location n on camera-n.
    auto directory = QSharedPointer<FakeCollector>::create();
    QStringList locations;
    std::set<QString> expected; // "location/ID/camera" of every sighting of a person seen at Loc1
    const uint32_t identity = std::max(1u, seeder.identityOf(1, 0));
    for (uint32_t location = 1; location <= options.locations; ++location) {
        locations << QString("Loc%1").arg(location);
        directory->cameras.insert(locations.last(), QString("camera-%1").arg(location));
        for (uint64_t index = 0; index < seeder.objectsAt(location); ++index) {
            if (seeder.isPerson(location, index) && seeder.identityOf(location, index) == identity) {
                expected.insert(QString("Loc%1/%2/camera-%1").arg(location).arg(index + 1));
            }
        }
    }
    ASSERT_GT(expected.size(), 5u);
    ReplyRecorder replies; // outlives the plug-in, which answers a search it stops as it goes
    PluginDelvixSrv plugin;
    plugin.setCameraInformationCollector(directory);
    plugin.InitialPluginBase(nullptr);
    const auto list = [](const std::vector<float>& vector) {
        return QVariantList(vector.begin(), vector.end());
    };
    const QVariantMap params{
        {KEY_LOC_ID_LIST, locations},
        {KEY_START_TIMESTAMP, qint64(options.firstTime) * 1000},
        {KEY_END_TIMESTAMP, (qint64(options.firstTime) + options.spanSeconds + 3600) * 1000},
        {KEY_FEATURE, list(seeder.identityBody(identity))},
        {KEY_FACE_FEATURE, list(seeder.identityFace(identity))}};
    RequestSenderInfo sender;
    sender.senderHandle = &data;
    plugin.Request(CMD_START_REID_SEARCH, params, sender, replies.callback());
    ASSERT_TRUE(replies.waitFinal(60000));
    EXPECT_EQ(replies.last().code, RC_SUCCESS);
    std::set<QString> found;
    for (const QVariant& hit : replies.progress()) {
        const QVariantMap map = hit.toMap();
        found.insert(QStringList{map.value(KEY_LOC_ID).toString(), map.value(KEY_OBJECT_ID).toString(),
                                 map.value(KEY_NODE_ID).toString()}
                         .join('/'));
    }
    EXPECT_EQ(found.size(), replies.progress().size()); // no duplicates
    EXPECT_EQ(found, expected);
}
