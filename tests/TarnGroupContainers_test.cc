// Group containers: which ones a change of entitlements stages for deletion,
// what the boot reconciliation removes, and the owner look-up. Three users:
// the personal one and enterprise E-1 have homes, enterprise E-2 has none.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <future>
#include <thread>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnCommandStageForDelete.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnGroupManager.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/PlatformLog.h"
#include "support/ResultCode.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using Ids = std::vector<std::string>;

constexpr const char* kLibrary = "/private/var/root/Library/TarnKeeper";
constexpr const char* kE1Home = "/private/var/personas/e1";
constexpr const char* kE2Home = "/private/var/personas/e2";

// One staged deletion, as the tests compare them.
struct Staged {
    std::string user;
    std::string group;
    TarnContainerClass containerClass;
    bool useLocking;
    bool operator==(const Staged&) const = default;
    bool operator<(const Staged& o) const {
        return std::tie(user, group, containerClass, useLocking) <
               std::tie(o.user, o.group, o.containerClass, o.useLocking);
    }
};

void PrintTo(const Staged& s, std::ostream* os) {
    *os << "{" << s.user << ", " << s.group << ", class " << s.containerClass
        << (s.useLocking ? ", locking}" : ", no locking}");
}

// Every identity of every staged deletion on the queue, sorted; other
// commands fail the test.
std::vector<Staged> stagedOn(TarnCommandQueue& queue) {
    std::vector<Staged> all;
    for (const auto& command : queue.commands()) {
        auto stage = std::dynamic_pointer_cast<TarnCommandStageForDelete>(command);
        EXPECT_TRUE(stage) << "command " << command->command();
        if (!stage) continue;
        EXPECT_EQ(stage->containerIdentities().size(), 1u) << "one identity per command";
        for (const auto& identity : stage->containerIdentities()) {
            all.push_back({identity->userIdentity()->identifier(), identity->identifier(),
                           identity->containerClass(), stage->useLocking()});
        }
    }
    std::sort(all.begin(), all.end());
    return all;
}

TarnCodeSigningEntryRef entryWith(PlistDict entitlements,
                                  std::function<void(TarnCodeSigningEntry&)> adjust = nullptr) {
    auto e = std::make_shared<TarnCodeSigningEntry>(
        PlistDict{{kTarnEntitlementsKey, std::move(entitlements)}}, 2);
    if (adjust) adjust(*e);
    return e;
}

PlistDict appGroups(const Ids& groups) {
    return {{kTarnApplicationGroupsEntitlement, PlistArray(groups.begin(), groups.end())}};
}

PlistValue personaEntry(const char* type, const char* unique, uint64_t id, const char* layout) {
    PlistValue p{PlistDict{}};
    p.set("Type", type);
    p.set("UniqueString", unique);
    p.set("PersonaID", id);
    if (layout) p.set("LayoutPath", layout);
    return p;
}

class TarnGroupContainersTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TARN_REQUIRE_ROOT();
        PlatformLogSetQuiet(true);
        // Written before this root's shared caches are made, which read it once.
        auto bytes = PlistValue(PlistArray{personaEntry("personal", "P-1", 1000, nullptr),
                                           personaEntry("enterprise", "E-1", 1001, kE1Home),
                                           personaEntry("enterprise", "E-2", 1002, kE2Home)})
                         .toBinary();
        root_.writeFile("/etc/tarnkeeper/personas.plist", std::string(bytes.begin(), bytes.end()));
        root_.mkdirs(kE1Home);
        root_.mkdirs(kLibrary);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(true);
        // The shared mapping, made before the container cache that points at it.
        TarnCodeSigningMapping::TEST_setSharedInstance(makeMapping(kLibrary));
        mapping_ = TarnCodeSigningMapping::sharedInstance();
    }
    void TearDown() override {
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
        TarnCodeSigningMapping::TEST_setSharedInstance(nullptr);
    }

    static TarnUserIdentitySharedCache& users() {
        return TarnUserIdentitySharedCache::sharedInstance();
    }
    static TarnUserIdentityRef personal() { return users().userIdentityForPersonalPersona(); }
    static TarnUserIdentityRef e1() {
        return users().userIdentityForCurrentUserWithPersonaUniqueString("E-1");
    }

    std::unique_ptr<TarnCodeSigningMapping> makeMapping(const std::string& library) {
        root_.mkdirs(library);
        return std::make_unique<TarnCodeSigningMapping>(
            &users(), DispatchQueue::createSerial("com.ostrea.TarnKeeper.EntitlementQueue"),
            TarnSQLiteDB::initWithParentDirectoryURL(root_.at(library)));
    }

    static void store(TarnCodeSigningMapping& mapping, const std::string& id,
                      const TarnCodeSigningEntryRef& entry) {
        TarnStatus stored;
        mapping.queue()->sync(
            [&] { stored = mapping.codeSigningMappingDB()->addCodeSigningEntry(entry, id); });
        ASSERT_TRUE(stored.ok()) << stored.error()->description();
    }

    // What processing new code-signing info does for one group type.
    static void change(TarnCodeSigningMapping& mapping, const std::optional<Ids>& oldIds,
                       const std::optional<Ids>& newIds, TarnGroupType type,
                       TarnCommandQueue& queue) {
        mapping.queue()->sync([&] {
            mapping._onQueue_handleChangeFromOldGroupContainerIds(oldIds, newIds, type, &queue);
        });
    }

    TarnMetadataRef createGroup(const TarnUserIdentityRef& user, const std::string& group,
                                TarnContainerClass containerClass = TarnContainerClassAppGroup) {
        auto identity =
            TarnContainerIdentity::containerIdentityWithUserIdentity(user, group, containerClass);
        EXPECT_TRUE(identity.ok());
        uint64_t code = TarnSuccess;
        TarnMetadataRef made =
            test::withCode(connection_.createOrLookupContainerWithContainerIdentity(
                               identity.valueOr(nullptr), /*createIfNecessary=*/true,
                               /*transient=*/false, /*useLocking=*/true),
                           &code)
                .valueOr(nullptr);
        EXPECT_TRUE(made) << group << ": " << code;
        return made;
    }

    // Whether the cache still knows the user's container of that group.
    static bool cached(const TarnUserIdentityRef& user, const std::string& group,
                       TarnContainerClass containerClass = TarnContainerClassAppGroup) {
        auto identity =
            TarnContainerIdentity::containerIdentityWithUserIdentity(user, group, containerClass);
        return TarnContainerCache::sharedInstance()
            .containerForContainerIdentity(identity.valueOr(nullptr), /*transient=*/false,
                                           /*updateSandbox=*/false)
            .ok();
    }

    static std::vector<Staged> forUsersWithHomes(const Ids& groups, bool useLocking = true) {
        std::vector<Staged> all;
        for (const char* user : {"501", "E-1"})
            for (const auto& g : groups)
                all.push_back({user, g, TarnContainerClassAppGroup, useLocking});
        std::sort(all.begin(), all.end());
        return all;
    }

    TarnCodeSigningMapping* mapping_ = nullptr;
    TarnClientConnection connection_;
};

// Which dropped groups are staged: only those whose last stored reference is
// the changing identifier's own old list (count 1 when judged).
TEST_F(TarnGroupContainersTest, AChangeStagesOnlyGroupsItHeldTheLastReferenceTo) {
    struct Case {
        const char* name;
        // Stored entries other than the changing one ("com.a", which stores `oldIds`).
        std::vector<std::pair<std::string, TarnCodeSigningEntryRef>> others;
        std::optional<Ids> oldIds;
        std::optional<Ids> newIds;
        TarnGroupType type;
        Ids expected;
    };
    const auto invalid = [](TarnCodeSigningEntry& e) { e.setInvalid(true); };
    const auto placeholder = [](TarnCodeSigningEntry& e) { e.setPlaceholder(true); };
    const auto advance = [](TarnCodeSigningEntry& e) { e.setAdvanceCopy(true); };
    const Case cases[] = {
        {"only A names G", {}, Ids{"g"}, Ids{}, TarnGroupTypeApplication, {"g"}},
        {"A's entitlements removed",
         {},
         Ids{"g", "h"},
         std::nullopt,
         TarnGroupTypeApplication,
         {"g", "h"}},
        {"B still names G",
         {{"com.b", entryWith(appGroups({"g"}))}},
         Ids{"g"},
         Ids{},
         TarnGroupTypeApplication,
         {}},
        {"B names G as a single string",
         {{"com.b", entryWith({{kTarnApplicationGroupsEntitlement, "g"}})}},
         Ids{"g"},
         Ids{},
         TarnGroupTypeApplication,
         {}},
        {"only the dropped one goes",
         {{"com.b", entryWith(appGroups({"kept-by-b"}))}},
         Ids{"g", "kept-by-b", "stays"},
         Ids{"stays"},
         TarnGroupTypeApplication,
         {"g"}},
        {"reordered", {}, Ids{"g", "h"}, Ids{"h", "g"}, TarnGroupTypeApplication, {}},
        {"unchanged", {}, Ids{"g"}, Ids{"g"}, TarnGroupTypeApplication, {}},
        {"nothing before", {}, std::nullopt, Ids{"g"}, TarnGroupTypeApplication, {}},
        {"nothing at all", {}, std::nullopt, std::nullopt, TarnGroupTypeApplication, {}},
        {"invalid B still counts",
         {{"com.b", entryWith(appGroups({"g"}), invalid)}},
         Ids{"g"},
         Ids{},
         TarnGroupTypeApplication,
         {}},
        {"placeholder B still counts",
         {{"com.b", entryWith(appGroups({"g"}), placeholder)}},
         Ids{"g"},
         Ids{},
         TarnGroupTypeApplication,
         {}},
        {"advance copy B still counts",
         {{"com.b", entryWith(appGroups({"g"}), advance)}},
         Ids{"g"},
         Ids{},
         TarnGroupTypeApplication,
         {}},
        // Counted twice by A alone: the first occurrence is judged on 2, the
        // second on what is left, 1.
        {"listed twice by A", {}, Ids{"g", "g"}, Ids{}, TarnGroupTypeApplication, {"g"}},
        {"listed twice by A, once by B",
         {{"com.b", entryWith(appGroups({"g"}))}},
         Ids{"g", "g"},
         Ids{},
         TarnGroupTypeApplication,
         {}},
        {"system group", {}, Ids{"systemgroup.x"}, Ids{}, TarnGroupTypeSystem, {}},
        {"unknown type", {}, Ids{"g"}, Ids{}, static_cast<TarnGroupType>(2), {}},
    };
    int n = 0;
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        auto mapping = makeMapping(std::string(kLibrary) + "/case" + std::to_string(n++));
        // A's old entry is still stored while its change is judged.
        PlistDict oldEntitlements;
        if (c.oldIds) {
            const char* key = c.type == TarnGroupTypeSystem ? kTarnSystemGroupsEntitlement
                                                            : kTarnApplicationGroupsEntitlement;
            oldEntitlements[key] = PlistArray(c.oldIds->begin(), c.oldIds->end());
        }
        store(*mapping, "com.a", entryWith(oldEntitlements));
        for (const auto& [id, entry] : c.others) store(*mapping, id, entry);

        TarnCommandQueue queue;
        change(*mapping, c.oldIds, c.newIds, c.type, queue);
        EXPECT_EQ(stagedOn(queue), forUsersWithHomes(c.expected));
    }
    EXPECT_FALSE(fs::exists(root_.at(kE2Home))) << "a user without a home is left alone";
}

// A group no stored entitlement names is not the change's to remove: the
// boot reconciliation does that.
TEST_F(TarnGroupContainersTest, ADroppedGroupNobodyNamesWaitsForReconciliation) {
    store(*mapping_, "com.a", entryWith(appGroups({"other"})));
    createGroup(personal(), "orphan");
    TarnCommandQueue queue;
    change(*mapping_, Ids{"orphan"}, Ids{}, TarnGroupTypeApplication, queue);
    EXPECT_TRUE(stagedOn(queue).empty());

    TarnGroupManager manager(users());
    manager.reconcileGroupContainersOfType(TarnGroupTypeApplication, &queue);
    EXPECT_EQ(stagedOn(queue),
              (std::vector<Staged>{{"501", "orphan", TarnContainerClassAppGroup, false}}));
}

TEST_F(TarnGroupContainersTest, StagedDeletionsTakeTheContainersOfEveryUserWithAHome) {
    store(*mapping_, "com.a", entryWith(appGroups({"g", "shared"})));
    store(*mapping_, "com.b", entryWith(appGroups({"shared"})));
    for (const auto& user : {personal(), e1()}) {
        createGroup(user, "g");
        createGroup(user, "shared");
    }

    TarnCommandQueue queue;
    change(*mapping_, Ids{"g", "shared"}, Ids{}, TarnGroupTypeApplication, queue);
    ASSERT_EQ(stagedOn(queue), forUsersWithHomes({"g"}));
    // Nothing happens before the queue runs.
    EXPECT_TRUE(cached(personal(), "g"));

    ASSERT_TRUE(queue.executeAllUntilExhaustedOrError().ok());
    for (const auto& user : {personal(), e1()}) {
        SCOPED_TRACE(user->identifier());
        EXPECT_FALSE(cached(user, "g"));
        EXPECT_TRUE(cached(user, "shared"));
    }
}

// Boot reconciliation stages exactly the containers no stored entry names,
// without locking (its caller holds the global write lock), by their UUIDs.
TEST_F(TarnGroupContainersTest, ReconciliationStagesExactlyTheUnreferencedContainers) {
    store(*mapping_, "com.a",
          entryWith({{kTarnApplicationGroupsEntitlement, PlistArray{"used"}},
                     {kTarnSystemGroupsEntitlement, PlistArray{"systemgroup.used"}}}));
    store(*mapping_, "com.gone",
          entryWith(appGroups({"by-invalid"}), [](auto& e) { e.setInvalid(true); }));
    store(*mapping_, "com.old",
          entryWith({{kTarnSystemGroupContainersEntitlement, "systemgroup.legacy"}}));
    std::map<std::pair<std::string, std::string>, Uuid> uuids;
    for (const auto& user : {personal(), e1()}) {
        for (const char* group : {"used", "by-invalid", "orphan"}) {
            if (auto made = createGroup(user, group))
                uuids[{user->identifier(), group}] = made->uuid();
        }
    }
    for (const char* group : {"systemgroup.used", "systemgroup.legacy", "systemgroup.orphan"})
        createGroup(personal(), group, TarnContainerClassSystemGroup);

    TarnGroupManager manager(users());
    TarnCommandQueue queue;
    {
        TarnGlobalLockHolder lock(TarnGlobalLockHolder::Mode::Write);
        manager.reconcileGroupContainersOfType(TarnGroupTypeApplication, &queue);
    }
    ASSERT_EQ(stagedOn(queue), forUsersWithHomes({"orphan"}, /*useLocking=*/false));
    for (const auto& command : queue.commands()) {
        auto stage = std::static_pointer_cast<TarnCommandStageForDelete>(command);
        auto concrete = std::dynamic_pointer_cast<const TarnConcreteContainerIdentity>(
            stage->containerIdentities().front());
        ASSERT_TRUE(concrete) << "the container found, not whatever holds its name later";
        EXPECT_EQ(concrete->uuid(), (uuids[{concrete->userIdentity()->identifier(), "orphan"}]));
    }
    {
        TarnGlobalLockHolder lock(TarnGlobalLockHolder::Mode::Write);
        ASSERT_TRUE(queue.executeAllUntilExhaustedOrError().ok());
    }
    for (const auto& user : {personal(), e1()}) {
        SCOPED_TRACE(user->identifier());
        EXPECT_FALSE(cached(user, "orphan"));
        EXPECT_TRUE(cached(user, "used"));
        EXPECT_TRUE(cached(user, "by-invalid"));
    }
    EXPECT_FALSE(fs::exists(root_.at(kE2Home)));

    // System groups: the global class once, for the default user; the older
    // entitlement key still counts.
    TarnCommandQueue systemQueue;
    manager.reconcileGroupContainersOfType(TarnGroupTypeSystem, &systemQueue);
    const auto staged = stagedOn(systemQueue);
    ASSERT_EQ(staged.size(), 1u);
    EXPECT_EQ(staged[0].group, "systemgroup.orphan");
    EXPECT_EQ(staged[0].containerClass, TarnContainerClassSystemGroup);
    EXPECT_FALSE(staged[0].useLocking);

    TarnCommandQueue unknownQueue;
    manager.reconcileGroupContainersOfType(static_cast<TarnGroupType>(2), &unknownQueue);
    EXPECT_TRUE(stagedOn(unknownQueue).empty()) << "no counts: nothing may go";
}

TEST_F(TarnGroupContainersTest, OwnerLookUpAnswersTheGroupsOfTheClass) {
    store(*mapping_, "com.a",
          entryWith({{kTarnApplicationGroupsEntitlement, PlistArray{"g2", "g1"}},
                     {kTarnSystemGroupsEntitlement, PlistArray{"systemgroup.s", "nope"}}}));
    store(*mapping_, "com.old",
          entryWith({{kTarnSystemGroupContainersEntitlement, "systemgroup.legacy"}}));
    store(*mapping_, "com.none", entryWith({{"com.ostrea.security.system-container", true}}));
    store(*mapping_, "com.broken",
          entryWith({{kTarnApplicationGroupsEntitlement, PlistArray{"g", uint64_t{1}}}}));
    TarnGroupManager manager(users());

    struct Case {
        std::optional<std::string> owner;
        TarnContainerClass containerClass;
        Ids expected;
    };
    for (const Case& c : {Case{"com.a", TarnContainerClassAppGroup, {"g2", "g1"}},
                          Case{"com.a", TarnContainerClassSystemGroup, {"systemgroup.s"}},
                          Case{"com.old", TarnContainerClassSystemGroup, {"systemgroup.legacy"}},
                          Case{"com.old", TarnContainerClassAppGroup, {}},
                          Case{"com.none", TarnContainerClassAppGroup, {}},
                          Case{"com.broken", TarnContainerClassAppGroup, {}},
                          Case{"com.unknown", TarnContainerClassSystemGroup, {}},
                          Case{"", TarnContainerClassAppGroup, {}}}) {
        for (bool useLocking : {false, true}) {
            SCOPED_TRACE(*c.owner + " class " + std::to_string(c.containerClass) +
                         (useLocking ? " locking" : ""));
            auto groups = manager.groupContainerIdentifiersForOwnerIdentifier(
                c.owner, c.containerClass, useLocking);
            ASSERT_TRUE(groups.ok()) << groups.code(TarnSuccess);
            EXPECT_EQ(*groups, c.expected);
        }
    }

    auto notAString = manager.groupContainerIdentifiersForOwnerIdentifier(
        std::nullopt, TarnContainerClassAppGroup, /*useLocking=*/true);
    EXPECT_EQ(notAString.code(TarnSuccess), TarnErrorInvalidArgument);
}

TEST_F(TarnGroupContainersTest, OwnerLookUpWithLockingWaitsForTheGlobalLock) {
    store(*mapping_, "com.a", entryWith(appGroups({"g"})));
    TarnGroupManager manager(users());
    std::future<TarnResult<Ids>> answer;
    {
        TarnGlobalLockHolder lock(TarnGlobalLockHolder::Mode::Read);
        // Without locking it does not wait.
        auto unlocked = manager.groupContainerIdentifiersForOwnerIdentifier(
            "com.a", TarnContainerClassAppGroup, /*useLocking=*/false);
        EXPECT_EQ(unlocked.valueOr({}), Ids{"g"});
        answer = std::async(std::launch::async, [&] {
            return manager.groupContainerIdentifiersForOwnerIdentifier(
                "com.a", TarnContainerClassAppGroup, /*useLocking=*/true);
        });
        EXPECT_EQ(answer.wait_for(std::chrono::milliseconds(100)), std::future_status::timeout)
            << "answered while a reader held the global lock";
    }
    auto groups = answer.get();
    ASSERT_TRUE(groups.ok());
    EXPECT_EQ(*groups, Ids{"g"});
    EXPECT_EQ(gTarnLocks.TEST_allReaderWriterState(), 0) << "the lookup let its lock go";
}

}  // namespace
}  // namespace tarn
