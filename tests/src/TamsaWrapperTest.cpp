// The store wrapper: where it finds the store's files (the machine settings, read here from a
// settings folder of the test's own), and that the record it hands the store opens a real one.
#include "TamsaImplement.h"

#include <QDir>
#include <QSettings>
#include <QTemporaryDir>

#include <gtest/gtest.h>

namespace {

class TamsaWrapperTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        ASSERT_TRUE(m_settingsDir.isValid());
        QSettings::setPath(QSettings::NativeFormat, QSettings::SystemScope, m_settingsDir.path());
    }

    void write(const QString& key, const QString& value)
    {
        QSettings settings(QSettings::NativeFormat, QSettings::SystemScope, QStringLiteral("Quorvex, Inc."),
                           QStringLiteral("NOVIR"));
        settings.setValue(key, value);
        settings.sync();
        ASSERT_EQ(settings.status(), QSettings::NoError);
    }

    QTemporaryDir m_settingsDir;
};

TEST_F(TamsaWrapperTest, StoragePathComesFromThe32BitKeyFirstThenTheNativeOne)
{
    const QString server = QDir::separator() + QStringLiteral("Server");
    write(QStringLiteral("Software/Other/INSTALL_PATH"), QStringLiteral("/elsewhere"));
    EXPECT_EQ(TamsaImplement().getStoragesDBPath(), QString()) << "no key holds the value";
    write(QStringLiteral("Software/INSTALL_PATH"), QStringLiteral("/opt/native"));
    EXPECT_EQ(TamsaImplement().getStoragesDBPath(), QStringLiteral("/opt/native") + server);
    write(QStringLiteral("Software/WOW6432node/INSTALL_PATH"), QStringLiteral("/opt/wow"));
    EXPECT_EQ(TamsaImplement().getStoragesDBPath(), QStringLiteral("/opt/wow") + server);
}

TEST_F(TamsaWrapperTest, OpensTheStoreBelowTheInstallFolder)
{
    QTemporaryDir install;
    ASSERT_TRUE(install.isValid());
    write(QStringLiteral("Software/INSTALL_PATH"), install.path());
    TamsaImplement tamsa;
    void* database = nullptr;
    EXPECT_EQ(tamsa.initDatabase(&database), TAMSA_OK);
    ASSERT_NE(database, nullptr);
    EXPECT_EQ(Tamsa_PutObjectMetaInfo(database, 1, 1, R"({"ObjectMetaInfo":[]})"), 0);
    EXPECT_TRUE(QDir(install.filePath(QStringLiteral("Server"))).exists());
    EXPECT_EQ(tamsa.releaseDatabase(&database), TAMSA_OK);
    EXPECT_EQ(database, nullptr);
}

} // namespace
