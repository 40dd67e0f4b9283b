// The store wrapper: the initialisation record it hands the store, and where it finds the
// store's files (the machine settings, read here from a settings folder of the test's own).
#include "TamsaImplement.h"

#include <QDir>
#include <QSettings>
#include <QTemporaryDir>

#include <gtest/gtest.h>

#include <cstring>

namespace {

class StoragePathTest : public ::testing::Test
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

} // namespace

TEST(TamsaWrapperTest, InitialisationRecordBytes)
{
    const QByteArray record = TamsaWrapper::initRecord();
    ASSERT_EQ(record.size(), 704);
    const auto u16 = [&](int offset) {
        uint16_t value;
        std::memcpy(&value, record.constData() + offset, sizeof value);
        return value;
    };
    const auto u32 = [&](int offset) {
        uint32_t value;
        std::memcpy(&value, record.constData() + offset, sizeof value);
        return value;
    };
    EXPECT_EQ(u16(0), 704);
    EXPECT_EQ(u16(2), 19);
    EXPECT_EQ(u32(4), 5u);
    EXPECT_EQ(u16(8), 1);
    EXPECT_EQ(u32(668), 1u);
    int nonZero = 0;
    for (int i = 0; i < record.size(); ++i) {
        const bool known = i < 10 || (i >= 668 && i < 672);
        if (!known && record[i] != 0) {
            ++nonZero;
        }
    }
    EXPECT_EQ(nonZero, 0);
}

TEST_F(StoragePathTest, AbsentWhenNoKeyHoldsTheValue)
{
    write(QStringLiteral("Software/Other/INSTALL_PATH"), QStringLiteral("/elsewhere"));
    TamsaImplement tamsa;
    EXPECT_TRUE(tamsa.getStoragesDBPath().isEmpty());
}

TEST_F(StoragePathTest, NativeKeyWhenThe32BitKeyIsAbsent)
{
    write(QStringLiteral("Software/INSTALL_PATH"), QStringLiteral("/opt/novir"));
    TamsaImplement tamsa;
    EXPECT_EQ(tamsa.getStoragesDBPath(),
              QStringLiteral("/opt/novir") + QDir::separator() + QStringLiteral("Server"));
}

TEST_F(StoragePathTest, The32BitKeyComesFirst)
{
    write(QStringLiteral("Software/INSTALL_PATH"), QStringLiteral("/opt/native"));
    write(QStringLiteral("Software/WOW6432node/INSTALL_PATH"), QStringLiteral("/opt/wow"));
    TamsaImplement tamsa;
    EXPECT_EQ(tamsa.getStoragesDBPath(),
              QStringLiteral("/opt/wow") + QDir::separator() + QStringLiteral("Server"));
}
