// The plug-in's lifecycle: what AllPluginLoaded and path changes do with the case vault, and
// the delvix settings taken by name through the meta-object system.

#include "CaseDatabase.h"
#include "DelvixKeys.h"
#include "FakeWemlo.h"
#include "HostPluginManager.h"
#include "HostRelaySender.h"
#include "LogFacility.h"
#include "PluginDelvixSrv.h"
#include "PluginServerInfo.h"

#include <QDir>
#include <QMutex>
#include <QTemporaryDir>
#include <gtest/gtest.h>

namespace {

class Tools : public IFrameworkTools
{
public:
    explicit Tools(IPluginManager* manager)
        : m_manager(manager)
    {}
    IPluginManager* GetPluginManager() override { return m_manager; }
    INovirTunnelClient* GetNovirTunnelClient() override { return nullptr; }
    IRelaySender* GetRelaySender() override { return &m_relay; }

private:
    IPluginManager* m_manager;
    HostRelaySender m_relay;
};

QVariantList caseNames(PluginDelvixSrv& plugin)
{
    QVariant payload;
    plugin.Request(
        CMD_GET_CASE_LIST, QVariant(), RequestSenderInfo{},
        [&payload](bool, const QString&, const QString&, const QVariant& value) { payload = value; });
    QVariantList names;
    for (const QVariant& element : payload.toList()) {
        names << element.toMap().value(KEY_CASE_NAME);
    }
    return names;
}

class PluginLifecycleTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        for (const char* folder : {"a", "b", "c"}) {
            QDir(m_dir.path()).mkpath(QLatin1String(folder));
            CaseDatabase(path(folder))
                .addCase(QStringLiteral("case in %1").arg(QLatin1String(folder)), QStringLiteral("10000000"),
                         QString());
        }
        m_serverInfo = std::make_unique<PluginServerInfo>(path("a"));
        m_manager.registerPluginObject(PLUGIN_ID_SERVER_INFO, m_serverInfo.get());
    }
    QString path(const char* folder) const { return m_dir.filePath(QLatin1String(folder)); }

    QTemporaryDir m_dir;
    std::unique_ptr<PluginServerInfo> m_serverInfo;
    HostPluginManager m_manager;
    Tools m_tools{&m_manager};
};

} // namespace

TEST_F(PluginLifecycleTest, VaultFollowsTheServerPathUnlessOneWasInstalled)
{
    {
        PluginDelvixSrv plugin;
        plugin.InitialPluginBase(&m_tools);
        plugin.AllPluginLoaded();
        EXPECT_EQ(caseNames(plugin), QVariantList{QStringLiteral("case in a")});

        // Two changes in a row: the second path's vault is the one in use.
        m_serverInfo->setServerDatabasePath(path("b"));
        m_serverInfo->setServerDatabasePath(path("c"));
        EXPECT_EQ(caseNames(plugin), QVariantList{QStringLiteral("case in c")});
    }
    {
        // A vault installed before AllPluginLoaded stays.
        PluginDelvixSrv plugin;
        plugin.setCaseDatabase(std::make_shared<CaseDatabase>(path("b")));
        plugin.InitialPluginBase(&m_tools);
        plugin.AllPluginLoaded();
        EXPECT_EQ(caseNames(plugin), QVariantList{QStringLiteral("case in b")});
    }
}

TEST_F(PluginLifecycleTest, WithoutServerInformationTheVaultHasNoFileAndSaysSo)
{
    fakeWemloReset();
    LogFacility::reload(FAKE_WEMLO_PATH);
    HostPluginManager empty;
    Tools tools(&empty);
    PluginDelvixSrv plugin;
    plugin.InitialPluginBase(&tools);
    plugin.AllPluginLoaded();
    QString code;
    plugin.Request(
        CMD_ADD_CASE_WITH_ITEM, QVariantMap{{KEY_CASE_NAME, QStringLiteral("x")}}, RequestSenderInfo{},
        [&code](bool, const QString& strCode, const QString&, const QVariant&) { code = strCode; });
    EXPECT_EQ(code, RC_FAILURE);
    bool connectFailure = false;
    bool objectFailure = false;
    for (const FakeWemloLine& line : fakeWemloState().lines) {
        connectFailure |=
            line.text.find("ConnectPluginSignal serverDatabasePathChanged") != std::string::npos;
        objectFailure |= line.text == "PluginDelvixSrv::getServerDatabasePath, GetPluginObject failure";
    }
    EXPECT_TRUE(connectFailure);
    EXPECT_TRUE(objectFailure);
    EXPECT_FALSE(QDir(QStringLiteral("/PluginDelvix")).exists());
    fakeWemloReset();
}

TEST_F(PluginLifecycleTest, SettingsReachedByNameGateSearchesAndAreLogged)
{
    fakeWemloReset();
    LogFacility::reload(FAKE_WEMLO_PATH);
    PluginDelvixSrv plugin;
    plugin.InitialPluginBase(&m_tools);
    auto settingLines = []() {
        std::vector<std::string> lines;
        for (const FakeWemloLine& line : fakeWemloState().lines) {
            if ((line.selector & 0xff) == LogFacility::LevelSetting) {
                lines.push_back(line.text);
            }
        }
        return lines;
    };
    auto startSearchReplies = [&plugin]() {
        int replies = 0;
        QString code;
        plugin.Request(CMD_START_SEARCH, QVariantMap{}, RequestSenderInfo{},
                       [&](bool bFinal, const QString& strCode, const QString&, const QVariant& payload) {
                           ++replies;
                           code = strCode;
                           EXPECT_TRUE(bFinal);
                           EXPECT_FALSE(payload.isValid());
                       });
        return std::make_pair(replies, code);
    };

    // Settings without "enable" turn the plug-in off; missing keys read as off.
    ASSERT_TRUE(QMetaObject::invokeMethod(&plugin, "setEnableDelvix", Qt::DirectConnection,
                                          Q_ARG(QVariantMap, QVariantMap{})));
    EXPECT_EQ(startSearchReplies(), std::make_pair(1, RC_SUCCESS));
    ASSERT_TRUE(QMetaObject::invokeMethod(
        &plugin, "setEnableDelvix", Qt::DirectConnection,
        Q_ARG(QVariantMap,
              (QVariantMap{{QStringLiteral("enable"), true}, {QStringLiteral("LPREnable"), true}}))));
    EXPECT_EQ(settingLines(),
              (std::vector<std::string>{"Disable Delvix, Disable Face Delvix, Disable LPR Delvix",
                                        "Enable Delvix, Disable Face Delvix, Enable LPR Delvix"}));
    fakeWemloReset();
}
