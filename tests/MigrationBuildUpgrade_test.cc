// The build-upgrade migration on a scratch device: old logs, the old bundle
// container place, the ACL marker on a device without system containers,
// and well-known system containers found under a UUID name.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnContainerMigrator.h"
#include "Daemon/TarnDaemon.h"
#include "Daemon/TarnMigrationStatus.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/PlatformLog.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

constexpr const char* kOldLogs = "/private/var/mobile/Library/Logs/TarnKeeper";
constexpr const char* kLogs = "/private/var/root/Library/Logs/TarnKeeper";
constexpr const char* kSystemContainers = "/private/var/containers/Data/System";

class MigrationBuildUpgradeTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TARN_REQUIRE_ROOT();
        PlatformLogSetQuiet(true);
    }
    std::string read(const std::string& abs) {
        std::ifstream in(root_.at(abs));
        return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    }
    TarnStatus upgrade() {
        status_ = TarnMigrationStatus::initForSystemMigration();
        EXPECT_TRUE(status_);
        if (!status_) return TARN_ERROR_CODE(TarnErrorReadFailed, nullptr);
        return TarnContainerMigrator::sharedInstance().performSynchronousBuildUpgradeMigration(
            *status_);
    }
    bool recorded(const char* type) {
        auto reread = TarnMigrationStatus::initForSystemMigration();
        return reread && reread->hasMigrationOccurredForType(type);
    }
    std::unique_ptr<TarnMigrationStatus> status_;
};

TEST_F(MigrationBuildUpgradeTest, OldLogsMoveUpOneRotationAndTheOldDirectoryGoes) {
    for (const char* name : {"tarnkeeperd.log", "tarnkeeperd.log.0", "tarnkeeperd.log.1",
                             "tarnkeeperd.log.3", "tarnkeeperd.log.x", "notes"})
        root_.writeFile(std::string(kOldLogs) + "/" + name, name);
    ASSERT_TRUE(upgrade().ok());
    // A file numbered N is kept as N + 1 while that is within the kept count.
    const uint32_t kept = TarnLogRotationCount();
    for (uint32_t n : {0u, 1u, 3u}) {
        const std::string moved = std::string(kLogs) + "/tarnkeeperd.log." + std::to_string(n + 1);
        if (n + 1 <= kept)
            EXPECT_EQ("tarnkeeperd.log." + std::to_string(n), read(moved));
        else if (n != 0)  // the current log may rotate into .1 by itself
            EXPECT_FALSE(fs::exists(root_.at(moved))) << moved;
    }
    EXPECT_FALSE(fs::exists(root_.at(kOldLogs)));
}

TEST_F(MigrationBuildUpgradeTest, BundleContainersMoveToTheGlobalPlace) {
    root_.writeFile("/private/var/mobile/Containers/Bundle/Application/ABC/app", "x");
    ASSERT_TRUE(upgrade().ok());
    EXPECT_EQ("x", read("/private/var/containers/Bundle/Application/ABC/app"));
    EXPECT_FALSE(fs::exists(root_.at("/private/var/mobile/Containers/Bundle")));
}

TEST_F(MigrationBuildUpgradeTest, ACLMarkerOnlyWithoutSystemContainers) {
    ASSERT_TRUE(upgrade().ok());
    EXPECT_TRUE(recorded(kTarnMigrationTypeACL));
    // Nothing was made on the way.
    EXPECT_FALSE(fs::exists(root_.at(kSystemContainers)));
    EXPECT_FALSE(fs::exists(root_.at("/private/var/containers/Shared/SystemGroup")));

    fs::remove(root_.at("/private/var/root/Library/TarnKeeper/tarn_migration_status.plist"));
    root_.mkdirs(kSystemContainers);
    ASSERT_TRUE(upgrade().ok());
    EXPECT_FALSE(recorded(kTarnMigrationTypeACL)) << "their ACLs still need the data migration";
}

TEST_F(MigrationBuildUpgradeTest, WellKnownSystemContainerMovesToItsFixedName) {
    TarnClientConnection connection;
    auto identity = TarnContainerIdentity::containerIdentityWithUserIdentity(
        TarnUserIdentityCache::defaultUserIdentity(), std::string("com.ostrea.locationd"),
        TarnContainerClassSystemData);
    auto made = connection.createOrLookupContainerWithContainerIdentity(
        identity.valueOr(nullptr), /*createIfNecessary=*/true, /*transient=*/false,
        /*useLocking=*/true);
    ASSERT_TRUE(made.ok());
    const FileURL fixed = (*made)->url();
    ASSERT_EQ("com.ostrea.locationd", PathLastComponent(fixed));
    // As an older build left it: under a UUID name.
    const FileURL uuidName = PathJoin(PathParent(fixed), Uuid::generate().string());
    fs::rename(fixed, uuidName);
    TarnMutableMetadataRef moved = (*made)->copy();
    moved->setUrl(uuidName);
    ASSERT_TRUE(
        TarnContainerCache::sharedInstance()
            .addContainerMetadata(moved, uuidName, /*transient=*/false, /*updateSandbox=*/false)
            .ok());

    ASSERT_TRUE(upgrade().ok());
    EXPECT_TRUE(fs::exists(fixed));
    EXPECT_FALSE(fs::exists(uuidName));
    auto found = TarnContainerCache::sharedInstance().containerForContainerIdentity(
        identity.valueOr(nullptr), /*transient=*/false, /*updateSandbox=*/false);
    ASSERT_TRUE(found.ok());
    EXPECT_EQ(fixed, (*found)->url());
}

}  // namespace
}  // namespace tarn
