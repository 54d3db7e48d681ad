#include "Daemon/TarnGlobalConfiguration.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "Daemon/TarnPerUserConfiguration.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

class TarnGlobalConfigurationTest : public test::ScratchRootTest {
protected:
    TarnUserIdentityRef user(uint32_t uid, uint32_t type = TarnPersonaTypePersonal,
                             std::optional<std::string> persona = std::nullopt,
                             std::string home = "/private/var/mobile") {
        return TarnUserIdentity::initWithUID(uid, uid, root_.at(home), persona, type, uid);
    }
};

TEST_F(TarnGlobalConfigurationTest, BaseDirectoriesByClassAndTransience) {
    TarnGlobalConfiguration config;
    auto mobile = user(501);
    struct Case {
        TarnContainerClass c;
        bool transient;
        const char* path;
    };
    const Case cases[] = {
        {1, false, "/private/var/containers/Bundle/Application"},
        {8, true, "/private/var/containers/Temp/Bundle/Framework"},
        {12, false, "/private/var/containers/Data/System"},
        {13, true, "/private/var/root/Library/Caches/com.ostrea.tarnkeeperd/Temp/Shared/SystemGroup"},
        {2, false, "/private/var/mobile/Containers/Data/Application"},
        {7, true, "/private/var/mobile/Containers/Temp/Shared/AppGroup"},
        {11, false, "/private/var/mobile/Containers/Data/TempDir"},
    };
    for (const auto& c : cases) {
        auto url = config.containerDirectoryURLForUserIdentity(mobile, c.c, c.transient);
        ASSERT_TRUE(url) << c.c;
        EXPECT_EQ(*url, root_.at(c.path)) << c.c;
        EXPECT_TRUE(fs::is_directory(*url)) << "created: " << *url;
    }
    EXPECT_FALSE(config.globalContainerBaseURLWithContentClass(2, false));
    EXPECT_FALSE(config.globalContainerBaseURLWithContentClass(0, false));
    EXPECT_FALSE(config.containerDirectoryURLForUserIdentity(mobile, 0, false));
    EXPECT_FALSE(config.containerDirectoryURLForUserIdentity(mobile, 14, false));
}

TEST_F(TarnGlobalConfigurationTest, EnterpriseLayoutAndStaging) {
    TarnGlobalConfiguration config;
    auto enterprise = user(501, TarnPersonaTypeEnterprise, "E-1", "/private/var/PersonaVolumes/E-1");
    auto url = config.containerDirectoryURLForUserIdentity(enterprise, 2, false);
    ASSERT_TRUE(url);
    EXPECT_EQ(*url, root_.at("/private/var/PersonaVolumes/E-1/Containers/Data/Application"));
    EXPECT_EQ(config.stagingDirectoryURLForUserIdentity(enterprise, 2),
              root_.at("/private/var/PersonaVolumes/E-1/Containers/Staging"));
    EXPECT_EQ(config.stagingDirectoryURLForUserIdentity(enterprise, 12),
              root_.at("/private/var/root/Library/Caches/com.ostrea.tarnkeeperd/Staging"));
    EXPECT_EQ(config.stagingDirectoryURLForUserIdentity(user(501), 1),
              config.stagingDirectoryURLForUserIdentity(enterprise, 13));

    // The personal and the unspecific identity of one user share a configuration.
    EXPECT_EQ(config.getPerUserConfigurationForUserIdentity(user(501)).get(),
              config.getPerUserConfigurationForUserIdentity(user(501, TarnPersonaTypeUnspecific)).get());
    EXPECT_NE(config.getPerUserConfigurationForUserIdentity(user(501)).get(),
              config.getPerUserConfigurationForUserIdentity(enterprise).get());
}

// An identity without a home directory has no per-user directories, and
// nothing is made for it, least of all at the file system's root.
TEST_F(TarnGlobalConfigurationTest, AnIdentityWithoutAHomeGetsNoDirectories) {
    TarnGlobalConfiguration config;
    auto homeless = TarnUserIdentity::initWithUID(502, 502, FileURL(), std::string("E-2"),
                                                  TarnPersonaTypeEnterprise, 502);
    ASSERT_TRUE(homeless);
    EXPECT_FALSE(config.containerDirectoryURLForUserIdentity(homeless, 2, false));
    EXPECT_EQ(config.stagingDirectoryURLForUserIdentity(homeless, 2), FileURL());
    auto perUser = config.getPerUserConfigurationForUserIdentity(homeless);
    EXPECT_EQ(perUser->libraryDirectory(), FileURL());
    EXPECT_EQ(perUser->systemGroupContainerBackupDirectory(), FileURL());
    EXPECT_FALSE(fs::exists("/Containers/Staging"));
    EXPECT_FALSE(fs::exists("/Library/TarnKeeper"));
    // No identity at all: no directory either, and no crash.
    EXPECT_FALSE(config.getPerUserConfigurationForUserIdentity(nullptr)
                     ->containerDirectoryURLForContentClass(2, false));
}

TEST_F(TarnGlobalConfigurationTest, GettersAnswerEvenWhenCreationFails) {
    // A file where the directory belongs.
    root_.writeFile("/private/var/root/Library/TarnKeeper", "in the way");
    TarnGlobalConfiguration config;
    EXPECT_EQ(config.libraryDirectory(), root_.at("/private/var/root/Library/TarnKeeper"));
    EXPECT_EQ(config.replaceDirectory(), root_.at("/private/var/root/Library/TarnKeeper/Replace"));
    EXPECT_FALSE(config.migrationFileExistsWithName("Replace"));

    // Removed behind its back: the next call makes it again.
    auto dead = config.deathrowDirectory();
    fs::remove_all(dead);
    EXPECT_EQ(config.deathrowDirectory(), dead);
    EXPECT_TRUE(fs::is_directory(dead));
}

TEST_F(TarnGlobalConfigurationTest, MobileAccountAndHomes) {
    {
        TarnGlobalConfiguration config;
        EXPECT_EQ(config.currentMobileUserId(), 501u);
        EXPECT_EQ(config.currentMobileGroupId(), 501u);
    }
    // Malformed id fields are skipped line by line, and a negative one is not
    // read as the largest id.
    root_.writeFile("/etc/passwd",
                    "mobile:x:-1:501:m:/private/var/mobile:/bin/sh\n"
                    "mobile:x:5 01:501:m:/private/var/mobile:/bin/sh\n"
                    "mobile:x:99999999999:501:m:/private/var/mobile:/bin/sh\n"
                    "mobile:x:777:778:m:/private/var/mobile:/bin/sh\n");
    {
        TarnGlobalConfiguration config;
        EXPECT_EQ(config.currentMobileUserId(), 777u);
        EXPECT_EQ(config.currentMobileGroupId(), 778u);
    }
    root_.writeFile("/etc/passwd", "root:x:0:0:root:/private/var/root:/bin/sh\n");
    TarnGlobalConfiguration config;
    EXPECT_EQ(config.currentMobileUserId(), 0u);
    EXPECT_EQ(config.currentMobileGroupId(), 0u);
    EXPECT_TRUE(fs::is_directory(config.stagingDirectory())) << "keeps working";

    auto missingHome = user(600, TarnPersonaTypePersonal, std::nullopt, "/private/var/u600");
    TarnPerUserConfiguration perUser(missingHome);
    EXPECT_FALSE(perUser.existsUserBaseDirectory());
    EXPECT_FALSE(fs::exists(root_.at("/private/var/u600")));
    perUser.userBaseDirectory();
    EXPECT_TRUE(perUser.existsUserBaseDirectory());
    EXPECT_FALSE(fs::exists(perUser.systemContainerBackupDirectory())) << "never created";
    EXPECT_FALSE(perUser.containerDirectoryURLForContentClass(12, false));
}

TEST_F(TarnGlobalConfigurationTest, SharedInstanceFollowsTheRootPrefix) {
    auto& first = TarnGlobalConfiguration::sharedInstance();
    EXPECT_EQ(&first, &TarnGlobalConfiguration::sharedInstance());
    EXPECT_EQ(first.sharedContainersDirectory(), root_.at("/private/var/containers"));
    test::ScratchRoot other;
    auto& second = TarnGlobalConfiguration::sharedInstance();
    EXPECT_NE(&first, &second);
    EXPECT_EQ(second.sharedContainersDirectory(), other.at("/private/var/containers"));
}

}  // namespace
}  // namespace tarn
