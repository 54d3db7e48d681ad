// The imports of records kept before the code-signing store existed, and the
// boot pass that runs them with the app-group reconciliation.
#include <gtest/gtest.h>

#include <filesystem>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnCommandStageForDelete.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/HostConfiguration.h"
#include "Platform/PlatformLog.h"
#include "support/ResultCode.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

constexpr const char* kLibrary = "/private/var/root/Library/TarnKeeper";

PlistDict entitlementsNaming(const std::string& what) { return {{"com.example.flag", what}}; }

class CodeSigningImportsTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TARN_REQUIRE_ROOT();
        PlatformLogSetQuiet(true);
        root_.mkdirs(kLibrary);
        saved_ = HostConfiguration::shared();
        HostConfiguration::TEST_setShared(HostConfiguration{});
        TarnCodeSigningMapping::TEST_setSharedInstance(std::make_unique<TarnCodeSigningMapping>(
            &TarnUserIdentitySharedCache::sharedInstance(),
            DispatchQueue::createSerial("com.ostrea.TarnKeeper.EntitlementQueue"),
            TarnSQLiteDB::initWithParentDirectoryURL(root_.at(kLibrary))));
        mapping_ = TarnCodeSigningMapping::sharedInstance();
    }
    void TearDown() override {
        TarnCodeSigningMapping::TEST_setSharedInstance(nullptr);
        HostConfiguration::TEST_setShared(saved_);
    }

    void store(const std::string& id, TarnCodeSigningEntryRef entry) {
        TarnStatus stored;
        mapping_->queue()->sync(
            [&] { stored = mapping_->codeSigningMappingDB()->addCodeSigningEntry(entry, id); });
        ASSERT_TRUE(stored.ok());
    }
    TarnCodeSigningEntryRef stored(const std::string& id) {
        return mapping_->codeSigningEntryForIdentifier(id).valueOr(nullptr);
    }
    void writeLegacyFile(const PlistDict& content) {
        auto bytes = PlistValue(content).toBinary();
        root_.writeFile(std::string(kLibrary) + "/tarn_entitlements.plist",
                        std::string(bytes.begin(), bytes.end()));
    }

    // A container of the legacy mobile user (the default one for global
    // classes) holding `value` under the info key `key`.
    TarnMetadataRef containerWithInfo(const std::string& id, TarnContainerClass containerClass,
                                      const char* key, PlistValue value) {
        auto identity = TarnContainerIdentity::containerIdentityWithUserIdentity(
            TarnUserIdentityCache::userIdentityForLegacyMobileUser(), id, containerClass);
        auto made = connection_.createOrLookupContainerWithContainerIdentity(
            identity.valueOr(nullptr), /*createIfNecessary=*/true, /*transient=*/false,
            /*useLocking=*/true);
        EXPECT_TRUE(made.ok()) << id;
        if (!made.ok()) return nullptr;
        EXPECT_TRUE(connection_
                        .setInfoValue(std::move(value), std::string(key),
                                      (*made)->containerIdentity(), /*useLocking=*/true)
                        .ok());
        return *made;
    }
    // The info value as the cache and the file on disk now hold it.
    const PlistValue* infoOf(const TarnMetadataRef& container, const char* key) {
        latest_ = TarnContainerCache::sharedInstance().containerForContainerIdentity(
            container->containerIdentity());
        if (!latest_ || !latest_->info()) return nullptr;
        return latest_->info()->find(key);
    }

    HostConfiguration saved_;
    TarnCodeSigningMapping* mapping_ = nullptr;
    TarnClientConnection connection_;
    TarnMetadataRef latest_;
};

TEST_F(CodeSigningImportsTest, LegacyEntitlementsAreStoredByWhoVouchedForThem) {
    // Already stored and valid: kept. Stored but invalid: replaced.
    store("com.known", std::make_shared<TarnCodeSigningEntry>(
                           PlistDict{{kTarnEntitlementsKey, entitlementsNaming("store")}}, 2));
    auto invalid = std::make_shared<TarnCodeSigningEntry>(
        PlistDict{{kTarnEntitlementsKey, entitlementsNaming("stale")}}, 2);
    invalid->setInvalid(true);
    store("com.stale", invalid);
    writeLegacyFile({
        {"com.byinstaller", entitlementsNaming("legacy")},
        {"com.bycaller", entitlementsNaming("legacy")},
        {"com.parent", entitlementsNaming("legacy")},
        {"com.known", entitlementsNaming("legacy")},
        {"com.stale", entitlementsNaming("legacy")},
        {"com.notadict", PlistValue("just a string")},
        {"com.ostrea.TarnKeeper.ChildPluginBundleIDs",
         PlistDict{{"com.parent", PlistArray{"com.parent.widget", 7}}}},
        {"com.ostrea.TarnKeeper.EntitlementsRegisteredByCaller",
         PlistDict{{"com.bycaller", true}, {"com.parent", false}}},
        {"com.ostrea.TarnKeeper.PlaceholderEntitlements", PlistDict{{"com.parent", false}}},
    });

    mapping_->performAllCodeSigningMigrationAndReconciliationWithCommandQueue(nullptr);

    const PlistDict legacy = entitlementsNaming("legacy");
    auto byInstaller = stored("com.byinstaller");
    ASSERT_TRUE(byInstaller);
    EXPECT_TRUE(byInstaller->invalid()) << "not marked caller-registered";
    EXPECT_EQ(legacy, *byInstaller->entitlements());
    EXPECT_EQ(0u, byInstaller->dataContainerClass());

    auto byCaller = stored("com.bycaller");
    ASSERT_TRUE(byCaller);
    EXPECT_FALSE(byCaller->invalid());
    EXPECT_TRUE(byCaller->registeredByCaller());

    auto parent = stored("com.parent");
    ASSERT_TRUE(parent);
    EXPECT_TRUE(parent->invalid());
    EXPECT_TRUE(parent->placeholder()) << "any value in the placeholder table counts";
    EXPECT_EQ(std::vector<std::string>{"com.parent.widget"}, parent->childBundleIdentifiers());

    EXPECT_EQ(entitlementsNaming("store"), *stored("com.known")->entitlements());
    EXPECT_EQ(legacy, *stored("com.stale")->entitlements());
    EXPECT_FALSE(stored("com.notadict"));
    EXPECT_FALSE(fs::exists(root_.at(kLibrary) + "/tarn_entitlements.plist"));
}

TEST_F(CodeSigningImportsTest, AnUnreadableLegacyEntitlementsFileIsKept) {
    root_.writeFile(std::string(kLibrary) + "/tarn_entitlements.plist", "not a property list");
    mapping_->performAllCodeSigningMigrationAndReconciliationWithCommandQueue(nullptr);
    EXPECT_TRUE(fs::exists(root_.at(kLibrary) + "/tarn_entitlements.plist"));
}

TEST_F(CodeSigningImportsTest, CachedBundleInfoIsClearedWhetherImportedOrAlreadyStored) {
    const PlistDict cached{{"Entitlements", entitlementsNaming("cached")},
                           {"SigningInfo", PlistValue("x")}};
    TarnMetadataRef fresh = containerWithInfo("com.fresh", TarnContainerClassAppBundle,
                                              kTarnInfoCachedCodeSigningInfoKey, cached);
    TarnMetadataRef plugin = containerWithInfo("com.fresh.plugin", TarnContainerClassPluginBundle,
                                               kTarnInfoCachedCodeSigningInfoKey, cached);
    TarnMetadataRef known = containerWithInfo("com.known", TarnContainerClassAppBundle,
                                              kTarnInfoCachedCodeSigningInfoKey, cached);
    ASSERT_TRUE(fresh && plugin && known);
    store("com.known", std::make_shared<TarnCodeSigningEntry>(
                           PlistDict{{kTarnEntitlementsKey, entitlementsNaming("store")}}, 2));

    mapping_->performAllCodeSigningMigrationAndReconciliationWithCommandQueue(nullptr);

    auto imported = stored("com.fresh");
    ASSERT_TRUE(imported);
    EXPECT_EQ(entitlementsNaming("cached"), *imported->entitlements());
    EXPECT_EQ(2u, imported->dataContainerClass());
    EXPECT_EQ(4u, stored("com.fresh.plugin")->dataContainerClass());
    EXPECT_EQ(entitlementsNaming("store"), *stored("com.known")->entitlements());
    for (const TarnMetadataRef& container : {fresh, plugin, known}) {
        EXPECT_FALSE(infoOf(container, kTarnInfoCachedCodeSigningInfoKey))
            << container->identifier();
        EXPECT_TRUE(latest_);
    }
}

// Multi-user mode leaves app groups alone (their import and the removal of
// unreferenced ones); the other imports run either way.
TEST_F(CodeSigningImportsTest, MultiUserModeSkipsTheAppGroupSteps) {
    for (bool multiUser : {true, false}) {
        SCOPED_TRACE(multiUser ? "multi-user" : "single user");
        HostConfiguration host;
        if (multiUser) host.multiUserFlags = 0x80000000u;
        HostConfiguration::TEST_setShared(host);
        TarnMetadataRef data =
            containerWithInfo("com.grouped", TarnContainerClassAppData,
                              kTarnInfoGroupContainerIDsKey, PlistArray{"group.kept"});
        TarnMetadataRef orphan =
            containerWithInfo("group.orphan", TarnContainerClassAppGroup, "unused", PlistValue(1));
        TarnMetadataRef kept =
            containerWithInfo("group.kept", TarnContainerClassAppGroup, "unused", PlistValue(1));
        ASSERT_TRUE(data && orphan && kept);
        writeLegacyFile({{"com.legacy", entitlementsNaming("legacy")}});

        TarnCommandQueue queue;
        mapping_->performAllCodeSigningMigrationAndReconciliationWithCommandQueue(&queue);

        EXPECT_TRUE(stored("com.legacy"));
        std::vector<std::string> staged;
        for (const auto& command : queue.commands()) {
            auto stage = std::dynamic_pointer_cast<TarnCommandStageForDelete>(command);
            ASSERT_TRUE(stage);
            for (const auto& identity : stage->containerIdentities())
                staged.push_back(identity->identifier());
        }
        if (multiUser) {
            EXPECT_FALSE(stored("com.grouped"));
            EXPECT_TRUE(infoOf(data, kTarnInfoGroupContainerIDsKey));
            EXPECT_TRUE(staged.empty());
        } else {
            auto grouped = stored("com.grouped");
            ASSERT_TRUE(grouped);
            EXPECT_EQ((PlistDict{{kTarnApplicationGroupsEntitlement, PlistArray{"group.kept"}}}),
                      *grouped->entitlements());
            EXPECT_EQ(2u, grouped->dataContainerClass());
            EXPECT_FALSE(infoOf(data, kTarnInfoGroupContainerIDsKey));
            EXPECT_EQ(std::vector<std::string>{"group.orphan"}, staged);
        }
    }
}

// The decoder of the legacy file never fails as a whole: every identifier is
// answered, importable or with the reason it is not.
TEST_F(CodeSigningImportsTest, LegacyDecoderAnswersEveryIdentifier) {
    const PlistDict file{
        {"", PlistDict{}},
        {"com.a", PlistDict{}},
        {"com.b", PlistArray{}},
        {"com.ostrea.TarnKeeper.ChildPluginBundleIDs", PlistValue("not a table")},
        {"com.ostrea.TarnKeeper.EntitlementsRegisteredByCaller", PlistDict{{"com.a", "yes"}}},
    };
    auto entries = TarnCodeSigningMapping::_entriesFromLegacyEntitlements(file);
    ASSERT_EQ(3u, entries.size());
    EXPECT_FALSE(entries[0].entry);
    ASSERT_TRUE(entries[1].entry);
    EXPECT_TRUE(entries[1].entry->invalid()) << "only true registers";
    EXPECT_FALSE(entries[2].entry);
    EXPECT_FALSE(entries[2].why.empty());
}

}  // namespace
}  // namespace tarn
