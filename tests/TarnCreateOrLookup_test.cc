// Creating and looking up containers: staging then one rename into place,
// owners and modes per class, fixed names of well-known system containers,
// transient containers made anew, concurrent creation, and clean-up of a
// half-built container.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <barrier>
#include <filesystem>
#include <future>
#include <thread>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnDaemon.h"
#include "Daemon/TarnDataProtectionManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/ContainerLibrary.h"
#include "Platform/Failpoints.h"
#include "Platform/PlatformLog.h"
#include "Platform/SandboxUserState.h"
#include "support/ResultCode.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

using tarn::test::withCode;

namespace fs = std::filesystem;

class TarnCreateOrLookupTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TARN_REQUIRE_ROOT();
        PlatformLogSetQuiet(true);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        // A mapping of this root, made before the cache that points at it.
        root_.mkdirs("/private/var/root/Library/TarnKeeper");
        TarnCodeSigningMapping::TEST_setSharedInstance(std::make_unique<TarnCodeSigningMapping>(
            nullptr, DispatchQueue::createSerial("com.ostrea.TarnKeeper.EntitlementQueue"),
            TarnSQLiteDB::initWithParentDirectoryURL(
                root_.at("/private/var/root/Library/TarnKeeper"))));
    }
    void TearDown() override {
        FailpointClearAll();
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
        TarnCodeSigningMapping::TEST_setSharedInstance(nullptr);
    }

    static TarnContainerIdentityRef identity(const std::string& identifier,
                                             TarnContainerClass containerClass) {
        auto made = TarnContainerIdentity::containerIdentityWithUserIdentity(
            TarnUserIdentityCache::defaultUserIdentity(), identifier, containerClass);
        EXPECT_TRUE(made.ok()) << made.code(TarnSuccess);
        return made.valueOr(nullptr);
    }

    TarnMetadataRef create(const TarnContainerIdentityRef& id, bool transient = false,
                           uint64_t* code = nullptr) {
        uint64_t ignored = TarnSuccess;
        return withCode(connection_.createOrLookupContainerWithContainerIdentity(
                            id, /*createIfNecessary=*/true, transient, /*useLocking=*/true),
                        code ? code : &ignored)
            .valueOr(nullptr);
    }

    static size_t entriesIn(const FileURL& dir) {
        if (!fs::exists(dir)) return 0;
        return static_cast<size_t>(
            std::distance(fs::directory_iterator(dir), fs::directory_iterator()));
    }
    // Staging also holds the metadata writer's temporary files; only directories count.
    static size_t directoriesIn(const FileURL& dir) {
        size_t n = 0;
        if (fs::exists(dir))
            for (const auto& e : fs::directory_iterator(dir)) n += e.is_directory() ? 1 : 0;
        return n;
    }
    FileURL stagingFor(TarnContainerClass c) {
        return TarnGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(
            TarnUserIdentityCache::defaultUserIdentity(), c);
    }
    FileURL liveFor(TarnContainerClass c, bool transient = false) {
        return *TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
            TarnUserIdentityCache::defaultUserIdentity(), c, transient);
    }
    // Whether any item on death row (inside its unique slot) has this name.
    static bool onDeathRow(const std::string& name) {
        const FileURL deathRow = TarnGlobalConfiguration::sharedInstance().deathrowDirectory();
        for (const auto& slot : fs::directory_iterator(deathRow))
            if (fs::exists(slot.path() / name)) return true;
        return false;
    }

    TarnClientConnection connection_;
};

struct stat statOf(const FileURL& url) {
    struct stat st {};
    EXPECT_EQ(::lstat(url.c_str(), &st), 0) << url;
    return st;
}

TEST_F(TarnCreateOrLookupTest, LookupOfAMissingContainerFailsWith21AndLeavesNothingBehind) {
    for (bool transient : {false, true}) {
        uint64_t code = TarnSuccess;
        EXPECT_FALSE(withCode(connection_.createOrLookupContainerWithContainerIdentity(
                                  identity("com.example.missing", 2), false, transient, true),
                              &code));
        EXPECT_EQ(code, TarnErrorNotFound) << "transient " << transient;
    }
    EXPECT_EQ(directoriesIn(stagingFor(2)), 0u);
    EXPECT_EQ(entriesIn(liveFor(2)), 0u);
    EXPECT_EQ(entriesIn(liveFor(2, true)), 0u);

    uint64_t code = TarnSuccess;
    EXPECT_FALSE(withCode(
        connection_.createOrLookupContainerWithContainerIdentity(nullptr, true, false, true),
        &code));
    EXPECT_EQ(code, TarnErrorBadInput);
    EXPECT_FALSE(withCode(connection_.containersWithClass(14, false), &code));
    EXPECT_EQ(code, TarnErrorInvalidArgument);
}

// Owners and modes per class: the user for data, the installer for bundles,
// the daemon on top and the system user inside for system containers.
TEST_F(TarnCreateOrLookupTest, NewContainersAreStagedThenLiveWithTheirClassesOwnersAndModes) {
    struct Case {
        TarnContainerClass containerClass;
        uint32_t topOwner;
        uint32_t subOwner;
        mode_t subMode;
    };
    for (const Case& c : {Case{2, 501, 501, 0755}, Case{1, CONTAINER_INSTALLATION_UID, 0, 0},
                          Case{12, 0, CONTAINER_SYSTEM_UID, 0}, Case{7, 501, 501, 0755}}) {
        SCOPED_TRACE(c.containerClass);
        const std::string identifier = "com.example.owners" + std::to_string(c.containerClass);
        uint64_t code = TarnSuccess;
        TarnMetadataRef made = create(identity(identifier, c.containerClass), false, &code);
        ASSERT_TRUE(made) << code;
        EXPECT_FALSE(made->existed());
        EXPECT_EQ(PathParent(made->url()), liveFor(c.containerClass));

        // The directory's name and the recorded UUID are two different UUIDs.
        auto directoryUuid = Uuid::parse(PathLastComponent(made->url()));
        ASSERT_TRUE(directoryUuid);
        EXPECT_NE(*directoryUuid, made->uuid());
        auto onDisk = TarnMetadata::readAndValidateMetadataAtUrl(
            made->url(), TarnUserIdentityCache::defaultUserIdentity(), false);
        ASSERT_TRUE(onDisk.ok()) << (onDisk.error() ? onDisk.error()->description() : "");
        EXPECT_EQ((*onDisk)->uuid(), made->uuid());
        EXPECT_EQ(directoriesIn(stagingFor(c.containerClass)), 0u);

        struct stat top = statOf(made->url());
        EXPECT_EQ(top.st_uid, c.topOwner);
        // Group bits show the ACL mask on system containers.
        EXPECT_EQ(top.st_mode & 07707, 0705u);
        std::vector<std::string> names;
        uint64_t libraryCode = 0;
        ASSERT_TRUE(ContainerLibrarySubdirectoriesForClass(c.containerClass, &names, &libraryCode));
        for (const std::string& name : names) {
            struct stat sub = statOf(PathJoin(made->url(), name));
            EXPECT_TRUE(S_ISDIR(sub.st_mode)) << name;
            EXPECT_EQ(sub.st_uid, c.subOwner) << name;
            EXPECT_EQ(sub.st_mode & 0777, c.subMode) << name;
        }
        if (names.empty()) {
            EXPECT_EQ(entriesIn(made->url()), 1u) << "only the metadata file";
        }

        TarnMetadataRef again = create(identity(identifier, c.containerClass));
        ASSERT_TRUE(again);
        EXPECT_TRUE(again->existed());
        EXPECT_EQ(again->url(), made->url());
        EXPECT_EQ(again->uuid(), made->uuid());
    }

    uint64_t code = TarnSuccess;
    auto listed = withCode(connection_.containersWithClass(2, false), &code);
    ASSERT_TRUE(listed) << code;
    ASSERT_EQ(listed->size(), 1u);
    EXPECT_EQ(listed->front()->identifier(), "com.example.owners2");
}

TEST_F(TarnCreateOrLookupTest, WellKnownSystemContainersGetTheirFixedNames) {
    auto system = create(identity("com.ostrea.locationd", 12));
    ASSERT_TRUE(system);
    EXPECT_EQ(system->url(), PathJoin(liveFor(12), "com.ostrea.locationd"));
    auto group = create(identity("systemgroup.com.ostrea.activation", 13));
    ASSERT_TRUE(group);
    EXPECT_EQ(group->url(), PathJoin(liveFor(13), "systemgroup.com.ostrea.activation"));
    auto unlisted = create(identity("com.example.unlisted", 12));
    ASSERT_TRUE(unlisted);
    EXPECT_TRUE(Uuid::parse(PathLastComponent(unlisted->url())));
}

// An empty identifier is a valid one: created once, then found, never a
// live directory the cache refuses to hold.
TEST_F(TarnCreateOrLookupTest, AnEmptyIdentifierMakesOneContainer) {
    uint64_t code = TarnSuccess;
    auto made = create(identity("", 2), false, &code);
    ASSERT_TRUE(made) << code;
    EXPECT_FALSE(made->existed());
    auto again = create(identity("", 2), false, &code);
    ASSERT_TRUE(again) << code;
    EXPECT_TRUE(again->existed());
    EXPECT_EQ(again->url(), made->url());
    EXPECT_EQ(directoriesIn(liveFor(2)), 1u);
    // Its kernel mapping is kept like any other's.
    auto mobile = TarnUserIdentityCache::defaultUserIdentity();
    EXPECT_TRUE(SandboxUserState::sharedInstance().userStateItemIsRecordedWithPersona(
        mobile->posixUID(), mobile->kernelPersonaID(), TarnContainerClassSandboxItemType(2), "",
        made->url().c_str()));
    EXPECT_TRUE(TarnContainerCache::sharedInstance()
                    .removeContainerForUserIdentity(TarnUserIdentityCache::defaultUserIdentity(), 2,
                                                    "", false)
                    .ok());
}

TEST_F(TarnCreateOrLookupTest, ConcurrentCreationsOfOneIdentityMakeOneContainer) {
    for (int round = 0; round < 5; ++round) {
        auto id = identity("com.example.race" + std::to_string(round), 2);
        std::barrier start(2);
        TarnMetadataRef results[2];
        std::vector<std::thread> threads;
        for (int i = 0; i < 2; ++i)
            threads.emplace_back([&, i] {
                TarnClientConnection connection;
                uint64_t code = TarnSuccess;
                start.arrive_and_wait();
                results[i] = withCode(connection.createOrLookupContainerWithContainerIdentity(
                                          id, true, false, true),
                                      &code)
                                 .valueOr(nullptr);
            });
        for (auto& t : threads) t.join();
        ASSERT_TRUE(results[0] && results[1]);
        EXPECT_EQ(results[0]->uuid(), results[1]->uuid());
        EXPECT_EQ(results[0]->url(), results[1]->url());
        EXPECT_NE(results[0]->existed(), results[1]->existed()) << "exactly one made it";
    }
    EXPECT_EQ(entriesIn(liveFor(2)), 5u);
}

TEST_F(TarnCreateOrLookupTest, TransientContainersAreMadeAnewAndTheOldOneGoesToDeathRow) {
    // Hold deletion passes back so that death row can be inspected.
    TarnDeathRowQueue()->suspend();
    auto id = identity("com.example.transient", 2);
    auto first = create(id, true);
    auto second = create(id, true);
    ASSERT_TRUE(first && second);
    EXPECT_FALSE(second->existed());
    EXPECT_TRUE(second->transient());
    EXPECT_NE(first->url(), second->url());
    EXPECT_NE(first->uuid(), second->uuid());
    EXPECT_EQ(PathParent(second->url()), liveFor(2, true));
    EXPECT_FALSE(fs::exists(first->url()));
    EXPECT_TRUE(fs::exists(second->url()));
    EXPECT_TRUE(onDeathRow(PathLastComponent(first->url())));

    // A transient container is invisible to plain lookups.
    uint64_t code = TarnSuccess;
    EXPECT_FALSE(withCode(
        connection_.createOrLookupContainerWithContainerIdentity(id, false, false, true), &code));
    EXPECT_EQ(code, TarnErrorNotFound);
    TarnDeathRowQueue()->resume();
}

// A deletion pass that empties death row while an old transient container is
// on its way there must not leave it live next to its successor.
TEST_F(TarnCreateOrLookupTest, ATransientReplacedDuringADeletionPassLeavesOneLive) {
    auto id = identity("com.example.transient.pass", 2);
    auto first = create(id, true);
    ASSERT_TRUE(first);
    // The first move is the old container's into its death-row slot.
    ASSERT_TRUE(FailpointSet("fm.move", "sleep:300@1"));
    TarnMetadataRef second;
    std::thread replacing([&] { second = create(id, true); });
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    std::promise<uint64_t> passed;
    connection_.deleteContainersOnDeathRowWithCompletion(
        [&passed](uint64_t code) { passed.set_value(code); });
    EXPECT_EQ(passed.get_future().get(), TarnSuccess);
    replacing.join();
    ASSERT_TRUE(second);
    EXPECT_FALSE(fs::exists(first->url()));
    EXPECT_EQ(entriesIn(liveFor(2, true)), 1u);
}

// A failure after the staging directory exists: the half-built container goes
// to death row, nothing stays in staging and nothing appears live.
TEST_F(TarnCreateOrLookupTest, AFailureAfterStagingLeavesNoHalfBuiltContainer) {
    struct Case {
        const char* what;
        TarnContainerClass containerClass;
        std::vector<std::pair<const char*, const char*>> failpoints;
        uint64_t expected;
    };
    // The first move is the metadata file's, the second the rename into place.
    const Case cases[] = {
        {"rename into place", 2, {{"fm.move", "errno:5@2"}}, TarnErrorMoveStagingFailed},
        {"system ACL", 12, {{"fm.setTopLevelACL", "errno:5"}}, TarnErrorACLFailed},
        {"metadata write", 4, {{"fm.writeData", "errno:28"}}, TarnErrorWriteFailed},
        {"clean-up too",
         2,
         {{"fm.move", "errno:5@2"}, {"fm.createTemporaryDirectory", "errno:28"}},
         TarnErrorRemoveStagingFailed},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        FailpointClearAll();
        for (const auto& [name, action] : c.failpoints) ASSERT_TRUE(FailpointSet(name, action));
        uint64_t code = TarnSuccess;
        auto id = identity(std::string("com.example.broken.") + c.what, c.containerClass);
        EXPECT_FALSE(create(id, false, &code));
        EXPECT_EQ(code, c.expected);
        FailpointClearAll();

        EXPECT_EQ(entriesIn(liveFor(c.containerClass)), 0u);
        if (c.expected != TarnErrorRemoveStagingFailed) {
            EXPECT_EQ(directoriesIn(stagingFor(c.containerClass)), 0u);
        }
        code = TarnSuccess;
        EXPECT_FALSE(withCode(
            connection_.createOrLookupContainerWithContainerIdentity(id, false, false, true),
            &code));
        EXPECT_EQ(code, TarnErrorNotFound);
    }
}

// The class of a data container's subdirectories: a recorded class wins, then
// the first entitlement that holds a string; bundles and system containers get none.
TEST_F(TarnCreateOrLookupTest, RecordedClassThenEntitlementsDecideTheSubdirectoryClass) {
    using M = TarnDataProtectionManager;
    EXPECT_EQ(M::dataProtectionClassForEntitlements({{"DataProtectionClass", PlistValue(1)}}), 0);
    EXPECT_EQ(M::dataProtectionClassForEntitlements(
                  {{kTarnDefaultDataProtectionEntitlement, kTarnFileProtectionComplete},
                   {"DataProtectionClass", kTarnFileProtectionNone}}),
              1);
    EXPECT_EQ(M::dataProtectionClassForEntitlements(
                  {{"data-protection-class", PlistValue(3)},
                   {"DataProtectionClass", kTarnFileProtectionWriteOnly}}),
              2);
    EXPECT_EQ(M::dataProtectionClassForEntitlements({{"DataProtectionClass", "bogus"}}), 0);

    auto metadataOf = [](TarnContainerClass c, std::optional<PlistValue> info) {
        auto concrete =
            TarnConcreteContainerIdentity::containerIdentityWithUUID(
                Uuid::generate(), TarnUserIdentityCache::defaultUserIdentity(), "com.example.dp", c)
                .value();
        return TarnMetadataRef(
            TarnMetadata::initWithContainerIdentity(concrete, std::move(info), "/", std::nullopt));
    };
    PlistValue recorded(PlistDict{{kTarnInfoContentProtectionClassKey, PlistValue(3)}});
    EXPECT_EQ(
        TarnClientConnection::_dataProtectionClassForContainerMetadata(metadataOf(2, recorded)), 3);
    EXPECT_EQ(
        TarnClientConnection::_dataProtectionClassForContainerMetadata(metadataOf(1, recorded)), 0);
    EXPECT_EQ(
        TarnClientConnection::_dataProtectionClassForContainerMetadata(metadataOf(2, std::nullopt)),
        0)
        << "no entitlements stored";
}

}  // namespace
}  // namespace tarn
