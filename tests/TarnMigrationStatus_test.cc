#include "Daemon/TarnMigrationStatus.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnPropertyListFile.h"
#include "Platform/HostConfiguration.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

class TarnMigrationStatusTest : public test::ScratchRootTest {
  protected:
    void SetUp() override { runBuild("21A100"); }
    void TearDown() override { HostConfiguration::TEST_setShared(HostConfiguration{}); }

    static void runBuild(const std::string& build) {
        HostConfiguration host;
        host.buildVersion = build;
        host.releaseType = "Internal";
        HostConfiguration::TEST_setShared(host);
    }
    std::string library() const {
        return TarnGlobalConfiguration::sharedInstance().libraryDirectory();
    }
    std::string statusFile() const { return library() + "/tarn_migration_status.plist"; }
    void writePlist(const std::string& path, const PlistValue& value) const {
        std::filesystem::create_directories(PathParent(path));
        ASSERT_TRUE(Tarn_writeToURL(value, path, 0).ok());
    }
    PlistValue readStatusFile() const {
        auto read = Tarn_dictionaryWithContentsOfURL(statusFile(), 0);
        return read.ok() ? *read : PlistValue();
    }
};

TEST_F(TarnMigrationStatusTest, FreshDeviceIsAnEmptyStatusAndAnUpgradeUntilTheBuildIsRecorded) {
    auto status = TarnMigrationStatus::initForSystemMigration();
    ASSERT_TRUE(status);
    EXPECT_TRUE(status->migrationInfo().empty());
    EXPECT_TRUE(status->isBuildUpgrade());
    EXPECT_FALSE(status->hasMigrationOccurredForType(kTarnMigrationTypeACL));

    ASSERT_TRUE(status->writeCurrentBuildInfoToDisk());
    auto again = TarnMigrationStatus::initForSystemMigration();
    ASSERT_TRUE(again);
    EXPECT_FALSE(again->isBuildUpgrade()) << "the same build twice is no upgrade";

    runBuild("21A200");
    EXPECT_TRUE(TarnMigrationStatus::initForSystemMigration()->isBuildUpgrade());
}

TEST_F(TarnMigrationStatusTest, CompletedMigrationsAreRecordedWithTheirBuild) {
    auto status = TarnMigrationStatus::initForSystemMigration();
    ASSERT_TRUE(status);
    ASSERT_TRUE(status->setMigrationCompleteForType(kTarnMigrationTypeBundle));
    const PlistValue file = readStatusFile();
    const PlistValue* record = file.find(kTarnMigrationTypeBundle);
    ASSERT_TRUE(record);
    ASSERT_TRUE(record->find("TarnMigrationVersionNumber"));
    EXPECT_EQ(*record->find("TarnMigrationVersionNumber")->asString(), "21A100");
    EXPECT_TRUE(record->find("TarnMigrationTime") && record->find("TarnMigrationTime")->isString());

    // Any stored entry counts, whatever build it was recorded on.
    runBuild("22B1");
    EXPECT_TRUE(TarnMigrationStatus::initForSystemMigration()->hasMigrationOccurredForType(
        kTarnMigrationTypeBundle));
}

TEST_F(TarnMigrationStatusTest, LegacyMarkersAreFoldedIntoTheFileAndRemoved) {
    const std::string acl = library() + "/tarn_acl2_migration_complete.plist";
    writePlist(acl, PlistValue(PlistDict{{"Done", PlistValue(true)}}));

    auto status = TarnMigrationStatus::initForSystemMigration();
    ASSERT_TRUE(status);
    EXPECT_TRUE(status->hasMigrationOccurredForType(kTarnMigrationTypeACL));
    EXPECT_FALSE(status->hasMigrationOccurredForType(kTarnMigrationTypeBundle));
    const PlistValue file = readStatusFile();
    const PlistValue* folded = file.find(kTarnMigrationTypeACL);
    ASSERT_TRUE(folded && folded->find("Done"));
    EXPECT_FALSE(std::filesystem::exists(acl));

    // A marker that is not a property list is reported and kept; the rest fold.
    const std::string bundle = library() + "/tarn_bundle_migration_complete.plist";
    std::filesystem::remove(statusFile());
    root_.writeFile(bundle.substr(root_.path().size()), "not a plist");
    writePlist(acl, PlistValue(PlistDict{}));
    status = TarnMigrationStatus::initForSystemMigration();
    ASSERT_TRUE(status);
    EXPECT_TRUE(status->hasMigrationOccurredForType(kTarnMigrationTypeACL));
    EXPECT_FALSE(status->hasMigrationOccurredForType(kTarnMigrationTypeBundle));
}

TEST_F(TarnMigrationStatusTest, UnreadableFilesGiveNoStatusAndWrongTypesCountAsUpgrade) {
    // Not a property list: no status object, so no migration runs on a guess,
    // and the file stays for inspection.
    root_.writeFile(statusFile().substr(root_.path().size()), "garbage \x01\x02");
    EXPECT_FALSE(TarnMigrationStatus::initForSystemMigration());
    EXPECT_TRUE(std::filesystem::exists(statusFile()));

    // A top level of the wrong type is unreadable too.
    writePlist(statusFile(), PlistValue(PlistArray{PlistValue("x")}));
    EXPECT_FALSE(TarnMigrationStatus::initForSystemMigration());

    // Entries of the wrong type: the readable markers still count, and a last
    // build that names no version means the upgrade work runs again.
    writePlist(statusFile(), PlistValue(PlistDict{{kTarnMigrationTypeACL, PlistValue("odd")},
                                                  {"LastBuildInfo", PlistValue(7)}}));
    auto status = TarnMigrationStatus::initForSystemMigration();
    ASSERT_TRUE(status);
    EXPECT_TRUE(status->hasMigrationOccurredForType(kTarnMigrationTypeACL));
    EXPECT_TRUE(status->isBuildUpgrade());
}

TEST_F(TarnMigrationStatusTest, TheUserFileIsSeparateAndNeverFoldsLegacyMarkers) {
    writePlist(library() + "/tarn_acl2_migration_complete.plist", PlistValue(PlistDict{}));
    auto user = TarnMigrationStatus::initForMobileUserMigration();
    ASSERT_TRUE(user);
    EXPECT_TRUE(user->migrationInfo().empty());
    ASSERT_TRUE(user->setMigrationCompleteForType(kTarnMigrationTypeSubdirectory));
    EXPECT_NE(user->migrationFileURL(), statusFile());
    EXPECT_EQ(PathLastComponent(user->migrationFileURL()), "tarn_user_migration_status.plist");
    EXPECT_TRUE(TarnMigrationStatus::initForMobileUserMigration()->hasMigrationOccurredForType(
        kTarnMigrationTypeSubdirectory));
    EXPECT_FALSE(TarnMigrationStatus::initForSystemMigration()->hasMigrationOccurredForType(
        kTarnMigrationTypeSubdirectory));
}

}  // namespace
}  // namespace tarn
