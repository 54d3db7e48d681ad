#include "Daemon/TarnContainerCache.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>

#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Daemon/TarnWhitelist.h"
#include "Platform/ContainerLibrary.h"
#include "Platform/Notifications.h"
#include "Platform/PersonaRoster.h"
#include "Platform/PlatformLog.h"
#include "Platform/SandboxUserState.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

// The file-backed state with set calls that can be made to fail.
class FaultySandboxUserState : public FileSandboxUserState {
  public:
    using FileSandboxUserState::FileSandboxUserState;
    int setUserStateItemWithPersona(uint32_t uid, uint32_t personaID, uint64_t itemType,
                                    const char* identifier, const char* path) override {
        ++sets;
        if (failSets) return EIO;
        return FileSandboxUserState::setUserStateItemWithPersona(uid, personaID, itemType,
                                                                 identifier, path);
    }
    int endBatch() override {
        const int written = FileSandboxUserState::endBatch();
        return failWrites ? ENOSPC : written;
    }
    bool failSets = false;
    bool failWrites = false;
    int sets = 0;
};

// Every (type, identifier, persona) -> path of one user.
std::map<std::string, std::string> itemsOf(SandboxUserState& state, uint32_t uid) {
    std::map<std::string, std::string> items;
    state.iterateUserStateItems(uid, [&](uint64_t type, const SandboxUserStateItem* item) {
        items[std::to_string(type) + ":" + item->identifier + ":" +
              std::to_string(item->personaID)] = item->path.value_or("");
    });
    return items;
}

class TarnContainerCacheTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        PlatformLogSetQuiet(true);
        state_ = std::make_unique<FaultySandboxUserState>(FileSandboxUserState::defaultDirectory());
        cache_ = makeCache();
    }
    void TearDown() override {
        PlatformLogSetQuiet(false);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
    }

    std::shared_ptr<TarnContainerCache> makeCache() {
        return TarnContainerCache::initWithUserIdentityCache(
            TarnUserIdentitySharedCache::sharedInstance(), nullptr, *state_);
    }

    TarnUserIdentityRef mobile() { return TarnUserIdentityCache::defaultUserIdentity(); }

    FileURL base(TarnContainerClass c, bool transient = false,
                 const TarnUserIdentityRef& user = nullptr) {
        return *TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
            user ? user : mobile(), c, transient);
    }

    // Writes a container of `identifier` on disk under `name` (a new UUID by default).
    TarnMetadataRef makeContainer(TarnContainerClass c, const std::string& identifier,
                                  bool transient = false, std::string name = "",
                                  const TarnUserIdentityRef& user = nullptr) {
        Uuid uuid = Uuid::generate();
        if (name.empty()) name = uuid.string();
        FileURL dir = PathJoin(base(c, transient, user), name);
        std::filesystem::create_directories(dir);
        auto identity = TarnConcreteContainerIdentity::containerIdentityWithUUID(
                            uuid, user ? user : mobile(), identifier, c)
                            .value();
        auto m = TarnMetadata::initWithContainerIdentity(identity, std::nullopt, dir, std::nullopt);
        TarnStatus written = m->writeMetadataToDiskWithError();
        EXPECT_TRUE(written.ok()) << (written.error() ? written.error()->description() : "");
        return m;
    }

    TarnContainerIdentityRef identity(TarnContainerClass c, const std::string& identifier,
                                      const TarnUserIdentityRef& user = nullptr) {
        return TarnContainerIdentity::containerIdentityWithUserIdentity(user ? user : mobile(),
                                                                        identifier, c)
            .value();
    }

    TarnMetadataRef lookup(TarnContainerClass c, const std::string& identifier, uint64_t* code,
                           bool transient = false) {
        auto m = cache_->containerForContainerIdentity(identity(c, identifier), transient,
                                                       /*updateSandbox=*/true);
        *code = m.code(0);
        return m.valueOr(nullptr);
    }

    std::unique_ptr<FaultySandboxUserState> state_;
    std::shared_ptr<TarnContainerCache> cache_;
};

TEST_F(TarnContainerCacheTest, MetadataDeletedBehindTheDaemonGives44ThenNotFound) {
    auto made = makeContainer(2, "com.ostrea.notes");
    uint64_t code = 0;
    auto found = lookup(2, "com.ostrea.notes", &code);
    ASSERT_TRUE(found) << code;
    EXPECT_EQ(found->url(), made->url());
    EXPECT_EQ(found->uuid(), made->uuid());
    EXPECT_EQ(cache_->TEST_rebuildCount(), 1u);

    std::filesystem::remove(PathJoin(made->url(), kTarnMetadataFileName));
    EXPECT_FALSE(lookup(2, "com.ostrea.notes", &code));
    EXPECT_EQ(code, TarnErrorCacheInconsistent);
    EXPECT_FALSE(lookup(2, "com.ostrea.notes", &code));
    EXPECT_EQ(code, TarnErrorNotFound);
    EXPECT_EQ(cache_->TEST_rebuildCount(), 1u)
        << "the key's dictionary stays; nothing is rescanned";
    EXPECT_TRUE(itemsOf(*state_, 501).empty()) << "the stale mapping is withdrawn";
}

// A lookup finds its dictionary by the key's parts; should they hash or
// compare unlike the key's text, every lookup would rescan its class.
TEST_F(TarnContainerCacheTest, KeyPartsHashAndCompareLikeTheKeyText) {
    auto enterprise = TarnUserIdentity::initWithUID(502, 502, root_.at("/private/var/mobile"),
                                                    "A1B2-persona", TarnPersonaTypeEnterprise, 1001);
    ASSERT_TRUE(enterprise);
    const TarnContainerCache::CacheKeyHash hash;
    const TarnContainerCache::CacheKeyEqual equal;
    std::vector<std::string> keys;
    for (const TarnUserIdentityRef& user : {mobile(), enterprise, TarnUserIdentityRef()}) {
        for (TarnContainerClass c = 0; c <= 14; ++c) {
            const std::string text = TarnContainerCache::_cacheKeyForUserIdentity(user, c);
            const auto parts = TarnContainerCache::_cacheKeyPartsForUserIdentity(user, c);
            EXPECT_EQ(hash(parts), hash(text)) << text;
            EXPECT_TRUE(equal(parts, text)) << text;
            EXPECT_TRUE(equal(text, parts)) << text;
            for (const std::string& other : keys) {
                if (other == text) continue;  // global classes: one key for every user
                EXPECT_FALSE(equal(parts, other)) << text << " vs " << other;
            }
            keys.push_back(text);
        }
    }
    EXPECT_EQ(TarnContainerCache::_cacheKeyForUserIdentity(enterprise, 2), "[A1B2-persona]-appData");
}

TEST_F(TarnContainerCacheTest, RebuildKeepsTheLastOfTwoDirectoriesClaimingOneIdentifier) {
    makeContainer(2, "com.ostrea.twice");
    makeContainer(2, "com.ostrea.twice");
    auto listing = TarnFileManager::defaultManager().urlsForItemsInDirectoryAtURL(base(2));
    ASSERT_TRUE(listing.ok() && listing->size() == 2);
    uint64_t code = 0;
    auto found = lookup(2, "com.ostrea.twice", &code);
    ASSERT_TRUE(found) << code;
    EXPECT_EQ(found->url(), listing->back());
    EXPECT_EQ(itemsOf(*state_, 501).at("1:com.ostrea.twice:501"), listing->back());
}

TEST_F(TarnContainerCacheTest, OnlyUUIDNamesCountExceptWellKnownSystemContainers) {
    makeContainer(2, "com.ostrea.badname", false, "NotAUUID");
    makeContainer(2, "com.ostrea.good");
    uint64_t code = 0;
    EXPECT_FALSE(lookup(2, "com.ostrea.badname", &code));
    EXPECT_EQ(code, TarnErrorNotFound);
    EXPECT_TRUE(lookup(2, "com.ostrea.good", &code));

    EXPECT_FALSE(cache_->containerURL("/x/com.ostrea.random", 12));
    auto wellKnown = TarnWhitelist::sharedWhitelist().wellknownSystemContainers();
    if (wellKnown.empty()) GTEST_SKIP() << "the well-known list names no system container";
    const std::string id = wellKnown.front();
    EXPECT_TRUE(cache_->containerURL("/x/" + id, 12));
    EXPECT_FALSE(cache_->containerURL("/x/" + id, 2))
        << "well-known names count for system classes only";
    makeContainer(12, id, false, id);
    auto found = lookup(12, id, &code);
    ASSERT_TRUE(found) << code;
    EXPECT_EQ(PathLastComponent(found->url()), id);
    EXPECT_EQ(itemsOf(*state_, 0).count("4:" + id + ":501"), 1u)
        << "system containers are filed under user 0";
}

TEST_F(TarnContainerCacheTest, AddBeforeTheClassWasBuiltRecordsNothing) {
    auto made = makeContainer(2, "com.ostrea.early");
    TarnStatus added = cache_->addContainerMetadata(made, made->url(), /*transient=*/false,
                                                    /*updateSandbox=*/false);
    EXPECT_TRUE(added.ok());
    EXPECT_EQ(cache_->TEST_rebuildCount(), 0u);
    EXPECT_EQ(state_->sets, 0);
    // The next lookup finds it on disk.
    uint64_t code = 0;
    EXPECT_TRUE(lookup(2, "com.ostrea.early", &code));
    EXPECT_EQ(cache_->TEST_rebuildCount(), 1u);

    // Bad input is refused with TarnErrorCacheInvalidInput, never recorded.
    added = cache_->addContainerMetadata(made, "relative/path", /*transient=*/false,
                                         /*updateSandbox=*/true);
    EXPECT_EQ(added.code(0), uint64_t{TarnErrorCacheInvalidInput});
    EXPECT_EQ(cache_->removeContainerForUserIdentity(mobile(), 14, "x", false).code(0),
              uint64_t{TarnErrorCacheInvalidInput});
    EXPECT_EQ(cache_->allContainersForUserIdentity(mobile(), 0, false).code(0),
              uint64_t{TarnErrorCacheInvalidInput});
}

TEST_F(TarnContainerCacheTest, TransientContainersAreNeverPushed) {
    makeContainer(2, "com.ostrea.temp", true);
    uint64_t code = 0;
    ASSERT_TRUE(lookup(2, "com.ostrea.temp", &code, true)) << code;
    auto extra = makeContainer(2, "com.ostrea.temp2", true);
    TarnStatus added = cache_->addContainerMetadata(extra, extra->url(), /*transient=*/true,
                                                    /*updateSandbox=*/true);
    ASSERT_TRUE(added.ok());
    ASSERT_TRUE(cache_->removeContainerForUserIdentity(mobile(), 2, "com.ostrea.temp", true).ok());
    EXPECT_EQ(state_->sets, 0);
    EXPECT_FALSE(lookup(2, "com.ostrea.temp", &code, false)) << "live and transient are apart";
}

TEST_F(TarnContainerCacheTest, RestartAnswersFromTheSandboxStateWithoutARescan) {
    auto made = makeContainer(2, "com.ostrea.mail");
    makeContainer(2, "com.ostrea.other");
    uint64_t code = 0;
    ASSERT_TRUE(lookup(2, "com.ostrea.mail", &code));

    // A new daemon: fresh state object over the same files, fresh cache.
    state_ = std::make_unique<FaultySandboxUserState>(FileSandboxUserState::defaultDirectory());
    cache_ = makeCache();
    auto found = lookup(2, "com.ostrea.mail", &code);
    ASSERT_TRUE(found) << code;
    EXPECT_EQ(found->url(), made->url());
    EXPECT_EQ(cache_->TEST_rebuildCount(), 0u);
    EXPECT_EQ(cache_->TEST_kernelHitCount(), 1u);

    // Transient lookups and lookups without kernel access scan.
    auto scanned = cache_->containerForContainerIdentity(identity(2, "com.ostrea.mail"),
                                                         /*transient=*/false,
                                                         /*updateSandbox=*/true,
                                                         /*allowKernelLookup=*/false);
    EXPECT_TRUE(scanned.ok());
    EXPECT_EQ(cache_->TEST_rebuildCount(), 1u);
}

TEST_F(TarnContainerCacheTest, ASandboxPathThatNoLongerHoldsTheContainerIsNotTrusted) {
    auto made = makeContainer(2, "com.ostrea.moved");
    auto decoy = makeContainer(2, "com.ostrea.decoy");
    // The state claims the decoy's directory for "moved".
    ASSERT_EQ(
        state_->setUserStateItemWithPersona(501, 501, 1, "com.ostrea.moved", decoy->url().c_str()),
        0);
    uint64_t code = 0;
    auto found = lookup(2, "com.ostrea.moved", &code);
    ASSERT_TRUE(found) << code;
    EXPECT_EQ(found->url(), made->url()) << "a mismatching sandbox answer falls back to a scan";
    EXPECT_EQ(cache_->TEST_kernelHitCount(), 0u);
    EXPECT_EQ(cache_->TEST_rebuildCount(), 1u);
}

TEST_F(TarnContainerCacheTest, PushFailuresKeepTheContainer) {
    makeContainer(2, "com.ostrea.pushfail");
    state_->failSets = true;
    uint64_t code = 0;
    EXPECT_TRUE(lookup(2, "com.ostrea.pushfail", &code)) << code;
    EXPECT_GT(state_->sets, 0);
    EXPECT_FALSE(cache_->setSandboxContainerMappingForUserIdentity(mobile(), "x", 2, "/p"));
    EXPECT_TRUE(cache_->setSandboxContainerMappingForUserIdentity(mobile(), "x", 1, "/p"))
        << "bundle classes are never pushed";
    EXPECT_FALSE(cache_->setSandboxContainerMappingForUserIdentity(mobile(), "x", 14, "/p"));
    // A pair set in memory but not written out is a failed push too.
    state_->failSets = false;
    state_->failWrites = true;
    EXPECT_FALSE(cache_->setSandboxContainerMappingForUserIdentity(mobile(), "y", 2, "/q"));
    state_->failWrites = false;
}

TEST_F(TarnContainerCacheTest, ARebuildOfRecordedMappingsWritesNothingButLogsEveryPush) {
    const std::string logPath = root_.at("/platform.log");
    PlatformLogSetFile(logPath);
    auto a = makeContainer(2, "com.ostrea.one");
    auto b = makeContainer(2, "com.ostrea.two");
    uint64_t code = 0;
    ASSERT_TRUE(lookup(2, "com.ostrea.one", &code)) << code;
    const int setsAfterFirst = state_->sets;
    EXPECT_GT(setsAfterFirst, 0);

    // A restart: the state still holds both mappings; one of them now points
    // elsewhere and must be corrected.
    ASSERT_EQ(state_->setUserStateItemWithPersona(501, 501, 1, "com.ostrea.two", "/stale"), 0);
    const int setsBefore = state_->sets;
    cache_ = makeCache();
    auto rebuilt = cache_->containerForContainerIdentity(identity(2, "com.ostrea.one"),
                                                         /*transient=*/false,
                                                         /*updateSandbox=*/true,
                                                         /*allowKernelLookup=*/false);
    ASSERT_TRUE(rebuilt.ok());
    EXPECT_EQ(state_->sets - setsBefore, 2) << "only the stale mapping is cleared and set";
    auto items = itemsOf(*state_, 501);
    EXPECT_EQ(items["1:com.ostrea.one:501"], a->url());
    EXPECT_EQ(items["1:com.ostrea.two:501"], b->url());
    PlatformLogSetFile("");

    std::ifstream in(logPath);
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    size_t pushes = 0;
    for (size_t at = 0; (at = text.find("Pushed user: 501, itemType: 1, identifier com.ostrea.one, "
                                        "class: 2, persona id: 501, path: " +
                                            a->url(),
                                        at)) != std::string::npos;
         ++at)
        ++pushes;
    EXPECT_EQ(pushes, 2u) << "an unchanged mapping is still logged as pushed\n" << text;
}

TEST_F(TarnContainerCacheTest, AClassDirectoryReachedThroughALinkIsScannedByPath) {
    auto made = makeContainer(2, "com.ostrea.linked");
    const FileURL directory = base(2);
    std::filesystem::rename(directory, directory + ".real");
    std::filesystem::create_directory_symlink(directory + ".real", directory);
    uint64_t code = 0;
    auto found = lookup(2, "com.ostrea.linked", &code);
    ASSERT_TRUE(found) << code;
    EXPECT_EQ(found->url(), made->url());
    EXPECT_EQ(itemsOf(*state_, 501)["1:com.ostrea.linked:501"], made->url());
}

TEST_F(TarnContainerCacheTest, AllContainersDropsEntriesWhoseMetadataIsGone) {
    auto a = makeContainer(4, "com.ostrea.a.ext");
    makeContainer(4, "com.ostrea.b.ext");
    auto all = cache_->allContainersForUserIdentity(mobile(), 4, false);
    ASSERT_TRUE(all.ok());
    EXPECT_EQ(all->size(), 2u);
    std::filesystem::remove(PathJoin(a->url(), kTarnMetadataFileName));
    all = cache_->allContainersForUserIdentity(mobile(), 4, false);
    ASSERT_TRUE(all.ok());
    ASSERT_EQ(all->size(), 1u);
    EXPECT_EQ(all->front()->identifier(), "com.ostrea.b.ext");
    uint64_t code = 0;
    EXPECT_FALSE(lookup(4, "com.ostrea.a.ext", &code));
    EXPECT_EQ(code, TarnErrorNotFound);
}

// Only a file that is gone makes an entry stale. When the file cannot be
// looked at (here a loop of links where its directory was), the entry stays:
// dropping it would let the next creation build a second container.
TEST_F(TarnContainerCacheTest, AMetadataFileThatCannotBeCheckedKeepsItsEntry) {
    auto a = makeContainer(2, "com.ostrea.looped");
    uint64_t code = 0;
    ASSERT_TRUE(lookup(2, "com.ostrea.looped", &code)) << code;
    const std::string moved = a->url() + ".away";
    std::filesystem::rename(a->url(), moved);
    std::filesystem::create_symlink(a->url(), a->url());  // ELOOP on the way to the file
    EXPECT_TRUE(lookup(2, "com.ostrea.looped", &code)) << code;
    std::filesystem::remove(a->url());
    std::filesystem::rename(moved, a->url());
    EXPECT_TRUE(lookup(2, "com.ostrea.looped", &code)) << code;
}

TEST_F(TarnContainerCacheTest, ConcreteLookupMatchesTheUUIDAndMarksTransience) {
    auto live = makeContainer(2, "com.ostrea.c");
    auto transient = makeContainer(2, "com.ostrea.c", true);
    auto concrete = [&](const TarnMetadataRef& m) {
        return TarnConcreteContainerIdentity::containerIdentityWithUUID(m->uuid(), mobile(),
                                                                        "com.ostrea.c", 2)
            .value();
    };
    auto a = cache_->containerForContainerIdentity(concrete(live));
    ASSERT_TRUE(a);
    EXPECT_FALSE(a->transient());
    auto b = cache_->containerForContainerIdentity(concrete(transient));
    ASSERT_TRUE(b);
    EXPECT_TRUE(b->transient());
    EXPECT_EQ(b->url(), transient->url());
    auto other = TarnConcreteContainerIdentity::containerIdentityWithUUID(
                     Uuid::generate(), mobile(), "com.ostrea.c", 2)
                     .value();
    EXPECT_FALSE(cache_->containerForContainerIdentity(other));
}

TEST_F(TarnContainerCacheTest, InvalidationWithdrawsMappingsAndPosts) {
    makeContainer(2, "com.ostrea.inv");
    uint64_t code = 0;
    ASSERT_TRUE(lookup(2, "com.ostrea.inv", &code));
    ASSERT_EQ(itemsOf(*state_, 501).size(), 1u);
    int posts = 0;
    int token = NotifyRegister(CONTAINER_NOTIFY_USER_INVALIDATED, [&] { ++posts; });
    cache_->invalidateUserIdentity(mobile());
    NotifyCancel(token);
    EXPECT_EQ(posts, 1);
    EXPECT_TRUE(itemsOf(*state_, 501).empty());
    ASSERT_TRUE(lookup(2, "com.ostrea.inv", &code));
    EXPECT_EQ(cache_->TEST_rebuildCount(), 2u) << "the dictionary was dropped";
}

TEST_F(TarnContainerCacheTest, PublicOperationsOnTheMappingQueueStopTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    root_.mkdirs("/private/var/root/Library/TarnKeeper");
    auto mapping = std::make_unique<TarnCodeSigningMapping>(
        nullptr, DispatchQueue::createSerial("com.ostrea.TarnKeeper.EntitlementQueue"),
        TarnSQLiteDB::initWithParentDirectoryURL(root_.at("/private/var/root/Library/TarnKeeper")));
    auto cache = TarnContainerCache::initWithUserIdentityCache(
        TarnUserIdentitySharedCache::sharedInstance(), mapping.get(), *state_);
    // Off the queue everything works.
    EXPECT_TRUE(cache->allContainersForUserIdentity(mobile(), 2, false).ok());
    // On it, the rule would wait for the queue it runs on.
    EXPECT_DEATH(mapping->queue()->sync([&] {
        (void)cache->shouldRegisterSandboxMappingWithUserIdentity(mobile(), "com.x", 2);
    }),
                 "");
    EXPECT_DEATH(mapping->queue()->sync([&] { cache->invalidateUserIdentity(mobile()); }), "");
}

// ---- The registration rule, with personas ----

using Kind = PersonaAttributes::Kind;

PersonaAttributesRef persona(Kind kind, std::optional<std::string> unique, uint32_t id,
                             std::vector<std::string> bundles = {}) {
    auto p = std::make_shared<PersonaAttributes>();
    p->kind = kind;
    p->uniqueString = std::move(unique);
    p->personaID = id;
    p->bundleIDs = std::move(bundles);
    return p;
}

class TarnContainerCacheRegistrationTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TarnUserIdentityCache::TEST_setPersonasAreSupported(true);
        PlatformLogSetQuiet(true);
        roster_.setList(PersonaAttributesList{
            persona(Kind::Personal, "P-1", 1000),
            persona(Kind::Universal, "U-1", 1001, {"com.ostrea.shared"}),
            persona(Kind::Enterprise, "E-1", 1002, {"com.corp.mail"}),
        });
        identities_ = std::make_unique<TarnUserIdentityCache>(roster_);
        identities_->TEST_setRetryDelay(std::chrono::milliseconds(0));
        state_ = std::make_unique<FileSandboxUserState>(FileSandboxUserState::defaultDirectory());
        cache_ = TarnContainerCache::initWithUserIdentityCache(*identities_, nullptr, *state_);
        personal_ = identities_->userIdentityForPersonalPersona();
        enterprise_ = identities_->userIdentityForCurrentUserWithPersonaUniqueString("E-1");
        ASSERT_TRUE(personal_ && enterprise_);
    }
    void TearDown() override {
        PlatformLogSetQuiet(false);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
    }

    bool rule(const TarnUserIdentityRef& u, const std::string& id, TarnContainerClass c) {
        return cache_->shouldRegisterSandboxMappingWithUserIdentity(u, id, c);
    }

    MemoryPersonaRoster roster_;
    std::unique_ptr<TarnUserIdentityCache> identities_;
    std::unique_ptr<FileSandboxUserState> state_;
    std::shared_ptr<TarnContainerCache> cache_;
    TarnUserIdentityRef personal_, enterprise_;
};

TEST_F(TarnContainerCacheRegistrationTest, DecisionsByClassAndPersona) {
    for (TarnContainerClass c : {1, 3, 5, 8, 12, 13}) {
        EXPECT_FALSE(rule(enterprise_, "com.any", c)) << c;
        EXPECT_TRUE(rule(personal_, "com.any", c)) << c;
    }
    EXPECT_TRUE(rule(enterprise_, "group.any", 7));
    EXPECT_TRUE(rule(personal_, "group.any", 7));

    // Listed only by the enterprise persona.
    EXPECT_FALSE(rule(personal_, "com.corp.mail", 2));
    EXPECT_TRUE(rule(enterprise_, "com.corp.mail", 2));
    // Listed by a universal persona: everyone owns it, only the personal side registers.
    EXPECT_TRUE(rule(personal_, "com.ostrea.shared", 2));
    EXPECT_FALSE(rule(enterprise_, "com.ostrea.shared", 2));
    // Listed nowhere: the personal identity's.
    EXPECT_TRUE(rule(personal_, "com.unlisted", 10));
    EXPECT_FALSE(rule(enterprise_, "com.unlisted", 10));
}

TEST_F(TarnContainerCacheRegistrationTest, EnterpriseGroupIsPushedUnderItsPersona) {
    auto dir =
        PathJoin(*TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
                     enterprise_, 7, false),
                 Uuid::generate().string());
    std::filesystem::create_directories(dir);
    auto identity = TarnConcreteContainerIdentity::containerIdentityWithUUID(
                        Uuid::generate(), enterprise_, "group.corp", 7)
                        .value();
    auto m = TarnMetadata::initWithContainerIdentity(identity, std::nullopt, dir, std::nullopt);
    TarnStatus added =
        cache_->addContainerMetadata(m, dir, /*transient=*/false, /*updateSandbox=*/true);
    ASSERT_TRUE(added.ok()) << (added.error() ? added.error()->description() : "");
    auto items = itemsOf(*state_, enterprise_->posixUID());
    EXPECT_EQ(items.at("2:group.corp:" + std::to_string(enterprise_->kernelPersonaID())), dir);

    // An enterprise flush drops the identity's dictionaries through the observer.
    identities_->flush();
    (void)identities_
        ->userIdentityForPersonalPersona();  // rebuilds, which reports the dropped identities
    cache_->TEST_drainInvalidations();
    EXPECT_TRUE(itemsOf(*state_, enterprise_->posixUID()).empty());
}

}  // namespace
}  // namespace tarn
