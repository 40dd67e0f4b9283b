// The store wrapper: where it finds the store's files (the machine settings, read here from a
// settings folder of the test's own), and that the record it hands the store opens a real one.
#include "TamsaImplement.h"

#include <QDir>
#include <QSettings>
#include <QTemporaryDir>

#include <gtest/gtest.h>

namespace {

TEST(TamsaWrapperTest, StoragePathComesFromThe32BitKeyFirstAndOpensTheStoreThere)
{
    QTemporaryDir settingsDir, install;
    ASSERT_TRUE(settingsDir.isValid() && install.isValid());
    QSettings::setPath(QSettings::NativeFormat, QSettings::SystemScope, settingsDir.path());
    QSettings settings(QSettings::NativeFormat, QSettings::SystemScope, QStringLiteral("Quorvex, Inc."),
                       QStringLiteral("NOVIR"));
    const auto pathAfter = [&](const char* key, const QString& value) {
        settings.setValue(QString::fromLatin1(key), value);
        settings.sync();
        return TamsaImplement().getStoragesDBPath();
    };
    const QString server = QDir::separator() + QStringLiteral("Server");
    EXPECT_EQ(pathAfter("Software/Other/INSTALL_PATH", "/elsewhere"), QString()) << "no key holds the value";
    EXPECT_EQ(pathAfter("Software/INSTALL_PATH", install.path()), install.path() + server);
    EXPECT_EQ(pathAfter("Software/WOW6432node/INSTALL_PATH", "/opt/wow"), "/opt/wow" + server);
    pathAfter("Software/WOW6432node/INSTALL_PATH", install.path());

    TamsaImplement tamsa;
    void* database = nullptr;
    ASSERT_EQ(tamsa.initDatabase(&database), TAMSA_OK);
    EXPECT_EQ(Tamsa_PutObjectMetaInfo(database, 1, 1, R"({"ObjectMetaInfo":[]})"), 0);
    EXPECT_TRUE(QDir(install.filePath(QStringLiteral("Server"))).exists());
    EXPECT_EQ(tamsa.releaseDatabase(&database), TAMSA_OK);
    EXPECT_EQ(database, nullptr);
}

} // namespace
