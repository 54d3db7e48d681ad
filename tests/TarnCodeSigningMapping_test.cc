// The code-signing mapping: views, group lists from entitlements,
// parent/child look-ups, invalidation, reference counts, the legacy
// mapping-file import and command 19; the processing of code-signing info,
// caller registration, removal with children, invalidation of apps without a
// bundle container and the import from a bundle container's metadata.
#include "Daemon/TarnCodeSigningMapping.h"

#include <atomic>
#include <chrono>
#include <filesystem>
#include <future>
#include <stdexcept>

#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnCommandStageForDelete.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/PlatformLog.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

constexpr const char* kLibrary = "/private/var/root/Library/TarnKeeper";

TarnCodeSigningEntryRef entryWith(PlistDict entitlements, uint64_t dataClass = 2,
                                  std::function<void(TarnCodeSigningEntry&)> adjust = nullptr) {
    auto e = std::make_shared<TarnCodeSigningEntry>(PlistDict{{kTarnEntitlementsKey, std::move(entitlements)}},
                                                    dataClass);
    if (adjust) adjust(*e);
    return e;
}

PlistDict infoWith(PlistDict entitlements) {
    return PlistDict{{kTarnEntitlementsKey, std::move(entitlements)}};
}

class TarnCodeSigningMappingTest : public test::ScratchRootTest {
protected:
    void SetUp() override {
        PlatformLogSetQuiet(true);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        root_.mkdirs(kLibrary);
    }
    void TearDown() override {
        TarnCodeSigningMapping::TEST_setSharedInstance(nullptr);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
    }

    std::unique_ptr<TarnCodeSigningMapping> makeMapping() {
        return std::make_unique<TarnCodeSigningMapping>(
            &TarnUserIdentitySharedCache::sharedInstance(),
            DispatchQueue::createSerial("com.ostrea.TarnKeeper.EntitlementQueue"),
            TarnSQLiteDB::initWithParentDirectoryURL(root_.at(kLibrary)));
    }

    // A private mapping when a test made one, else the shared one: the
    // container cache, made on first use for the scratch root, must see the
    // same mapping (a second one could not open the store).
    TarnCodeSigningMapping& mapping() {
        if (mapping_) return *mapping_;
        if (!shared_) {
            TarnCodeSigningMapping::TEST_setSharedInstance(makeMapping());
            shared_ = TarnCodeSigningMapping::sharedInstance();
        }
        return *shared_;
    }

    // Counts the entries the store writes from now on.
    void countStoreWrites() {
        mapping().queue()->sync([&] {
            mapping().codeSigningMappingDB()->TEST_storeStepHook = [this](const char* step) {
                if (std::string_view(step) == "info") ++writes_;
            };
        });
    }

    TarnStatus process(const std::string& id, std::optional<PlistDict> info,
                       PlistDict options = {}) {
        return mapping().processCodeSigningInfo(info, id, options, &commands_);
    }

    // The staged deletions queued so far, as "identifier/class"; each must lock.
    std::vector<std::string> staged() {
        std::vector<std::string> out;
        for (const auto& command : commands_.commands()) {
            auto stage = std::dynamic_pointer_cast<TarnCommandStageForDelete>(command);
            if (!stage || !stage->useLocking()) {
                out.push_back("unexpected command");
                continue;
            }
            for (const auto& identity : stage->containerIdentities())
                out.push_back(identity->identifier() + "/" +
                              std::to_string(identity->containerClass()));
        }
        return out;
    }

    // Writes a bundle container of `identifier` with `info` as its metadata info.
    void makeBundleContainer(TarnContainerClass containerClass, const std::string& identifier,
                             std::optional<PlistValue> info = std::nullopt) {
        const TarnUserIdentityRef owner = TarnUserIdentityCache::defaultUserIdentity();
        const Uuid uuid = Uuid::generate();
        const FileURL dir = PathJoin(
            *TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
                owner, containerClass, /*transient=*/false),
            uuid.string());
        std::filesystem::create_directories(dir);
        auto identity = TarnConcreteContainerIdentity::containerIdentityWithUUID(
                            uuid, owner, identifier, containerClass)
                            .value();
        TarnStatus written =
            TarnMetadata::initWithContainerIdentity(identity, std::move(info), dir, std::nullopt)
                ->writeMetadataToDiskWithError();
        ASSERT_TRUE(written.ok()) << written.error()->description();
    }

    void store(const std::string& id, const TarnCodeSigningEntryRef& entry) {
        TarnStatus stored;
        mapping().queue()->sync(
            [&] { stored = mapping().codeSigningMappingDB()->addCodeSigningEntry(entry, id); });
        ASSERT_TRUE(stored.ok()) << stored.error()->description();
    }

    std::set<std::string> identifiers() { return mapping().identifiersWithError().value(); }
    // The stored entry; empty when the read failed.
    TarnCodeSigningEntryRef storedEntry(const std::string& id) {
        return mapping().codeSigningEntryForIdentifier(id).valueOr(nullptr);
    }

    std::unique_ptr<TarnCodeSigningMapping> mapping_;
    TarnCodeSigningMapping* shared_ = nullptr;
    TarnCommandQueue commands_;
    std::atomic<int> writes_{0};
};

TEST_F(TarnCodeSigningMappingTest, ExternalViewHidesUncommittedAndInvalidEntries) {
    PlistDict ents{{"com.ostrea.security.system-container", true}};
    store("com.valid", entryWith(ents));
    store("com.placeholder", entryWith(ents, 2, [](auto& e) { e.setPlaceholder(true); }));
    store("com.advance", entryWith(ents, 2, [](auto& e) { e.setAdvanceCopy(true); }));
    store("com.invalid", entryWith(ents, 2, [](auto& e) { e.setInvalid(true); }));

    EXPECT_EQ(mapping().getCodeSigningInfoForIdentifier("com.valid"), (PlistDict{{kTarnEntitlementsKey, ents}}));
    for (const char* id : {"com.placeholder", "com.advance", "com.invalid"}) {
        EXPECT_FALSE(mapping().getCodeSigningInfoForIdentifier(id)) << id;
        EXPECT_EQ(mapping().entitlementsForIdentifier(id), ents) << id;
        EXPECT_TRUE(mapping().identifierHasSystemContainer(id)) << id;
    }
    EXPECT_FALSE(mapping().getCodeSigningInfoForIdentifier("com.unknown"));
    EXPECT_FALSE(mapping().entitlementsForIdentifier("com.unknown"));
    EXPECT_FALSE(mapping().getCodeSigningInfoForIdentifier(""));
}

TEST_F(TarnCodeSigningMappingTest, GroupListsFromEntitlements) {
    using Ids = std::optional<std::vector<std::string>>;
    store("com.single", entryWith({{"com.ostrea.security.application-groups", "group.one"},
                                   {"com.ostrea.security.system-groups", "systemgroup.one"}}));
    store("com.mixed", entryWith({{"com.ostrea.security.application-groups", PlistArray{"group.a", uint64_t{1}}},
                                  {"com.ostrea.security.system-groups", PlistArray{"systemgroup.a", true}}}));
    store("com.list", entryWith({{"com.ostrea.security.application-groups", PlistArray{"group.b", "group.a", "group.b"}},
                                 {"com.ostrea.security.system-groups",
                                  PlistArray{"systemgroup.x", "group.nope", "systemgroup.y"}},
                                 {"com.ostrea.security.system-group-containers", PlistArray{"systemgroup.old"}}}));
    store("com.fallback-empty", entryWith({{"com.ostrea.security.system-groups", PlistArray{}},
                                           {"com.ostrea.security.system-group-containers", "systemgroup.old"}}));
    store("com.fallback-absent", entryWith({{"com.ostrea.security.system-group-containers",
                                             PlistArray{"systemgroup.old", "nope"}}}));
    store("com.wrongtype", entryWith({{"com.ostrea.security.application-groups", PlistDict{}}}));

    EXPECT_EQ(mapping().appGroupIdentifiersForIdentifier("com.single"), Ids({"group.one"}));
    EXPECT_EQ(mapping().systemGroupIdentifiersForIdentifier("com.single"), Ids({"systemgroup.one"}));
    // One non-string spoils the whole list.
    EXPECT_EQ(mapping().appGroupIdentifiersForIdentifier("com.mixed"), std::nullopt);
    // A rejected primary list falls back; with no fallback key the answer is nothing.
    EXPECT_EQ(mapping().systemGroupIdentifiersForIdentifier("com.mixed"), std::nullopt);
    // Order and duplicates are kept; the prefix filter drops the stranger; the
    // fallback is not read when the primary has entries.
    EXPECT_EQ(mapping().appGroupIdentifiersForIdentifier("com.list"), Ids({"group.b", "group.a", "group.b"}));
    EXPECT_EQ(mapping().systemGroupIdentifiersForIdentifier("com.list"), Ids({"systemgroup.x", "systemgroup.y"}));
    EXPECT_EQ(mapping().systemGroupIdentifiersForIdentifier("com.fallback-empty"), Ids({"systemgroup.old"}));
    EXPECT_EQ(mapping().systemGroupIdentifiersForIdentifier("com.fallback-absent"), Ids({"systemgroup.old"}));
    EXPECT_EQ(mapping().appGroupIdentifiersForIdentifier("com.wrongtype"), std::nullopt);
    EXPECT_EQ(mapping().appGroupIdentifiersForIdentifier("com.unknown"), std::nullopt);
}

TEST_F(TarnCodeSigningMappingTest, FlagsClassParentsAndChildren) {
    store("com.app", entryWith({{"com.ostrea.security.system-container", false}}, 2, [](auto& e) {
              e.setChildBundleIdentifiers({"com.app.ext1", "com.app.ext2"});
              e.setRegisteredByCaller(true);
          }));
    store("com.app.ext1", entryWith({{"com.ostrea.security.system-container", uint64_t{1}}}, 4));
    EXPECT_FALSE(mapping().identifierHasSystemContainer("com.app"));
    EXPECT_TRUE(mapping().identifierHasSystemContainer("com.app.ext1"));
    EXPECT_FALSE(mapping().identifierHasSystemContainer("com.unknown"));
    EXPECT_TRUE(mapping().identifierHasCallerRegisteredEntitlements("com.app"));
    EXPECT_FALSE(mapping().identifierHasCallerRegisteredEntitlements("com.app.ext1"));
    EXPECT_EQ(mapping().dataContainerTypeForIdentifier("com.app.ext1"), 4u);
    EXPECT_EQ(mapping().dataContainerTypeForIdentifier("com.unknown"), 0u);
    EXPECT_EQ(mapping().parentIdentifierForChildIdentifier("com.app.ext2"), "com.app");
    EXPECT_EQ(mapping().parentIdentifierForChildIdentifier("com.app"), "");
    EXPECT_EQ(mapping().childBundleIdentifiersForParentIdentifier("com.app"),
              (std::vector<std::string>{"com.app.ext1", "com.app.ext2"}));
    EXPECT_TRUE(mapping().childBundleIdentifiersForParentIdentifier("com.app.ext1").empty());

    EXPECT_EQ(identifiers(), (std::set<std::string>{"com.app", "com.app.ext1"}));
    EXPECT_EQ(mapping().codeSigningEntryForIdentifier("com.unknown").code(TarnSuccess),
              TarnErrorDatabaseNotFound);
}

TEST_F(TarnCodeSigningMappingTest, InvalidationAndAdvanceCopies) {
    store("com.p", entryWith({}, 2, [](auto& e) { e.setChildBundleIdentifiers({"com.p.kid"}); }));
    store("com.p.kid", entryWith({}, 4));
    store("com.q", entryWith({}, 2, [](auto& e) { e.setChildBundleIdentifiers({"com.q.kid"}); }));
    store("com.q.kid", entryWith({}, 4));
    store("com.adv", entryWith({}, 2, [](auto& e) { e.setAdvanceCopy(true); }));

    ASSERT_TRUE(mapping().invalidateCodeSigningInfoForIdentifier("com.q").ok());
    EXPECT_TRUE(storedEntry("com.q")->invalid());
    EXPECT_FALSE(storedEntry("com.q.kid")->invalid());
    ASSERT_TRUE(mapping().invalidateCodeSigningInfoForIdentifierAndItsChildren("com.p").ok());
    EXPECT_TRUE(storedEntry("com.p")->invalid());
    EXPECT_TRUE(storedEntry("com.p.kid")->invalid());
    EXPECT_TRUE(mapping().invalidateCodeSigningInfoForIdentifier("com.unknown").ok());

    ASSERT_TRUE(mapping().removeAllAdvanceCopiesWithError().ok());
    EXPECT_EQ(identifiers().count("com.adv"), 0u);
    EXPECT_EQ(identifiers().size(), 4u);
}

TEST_F(TarnCodeSigningMappingTest, ReferenceCountsCoverEveryStoredEntry) {
    store("com.a", entryWith({{"com.ostrea.security.application-groups", PlistArray{"g.shared", "g.a", "g.a"}}}));
    store("com.b", entryWith({{"com.ostrea.security.application-groups", "g.shared"}}, 2,
                             [](auto& e) { e.setInvalid(true); }));
    store("com.c", entryWith({{"com.ostrea.security.application-groups", PlistArray{"g.shared"}},
                              {"com.ostrea.security.system-groups", PlistArray{"systemgroup.s", "unprefixed"}}},
                             2, [](auto& e) { e.setPlaceholder(true); }));
    store("com.d", entryWith({{"com.ostrea.security.application-groups", PlistArray{"g.never", uint64_t{2}}},
                              {"com.ostrea.security.system-groups", PlistArray{}},
                              {"com.ostrea.security.system-group-containers", "systemgroup.s"}}));
    store("com.e", entryWith({{"com.ostrea.security.application-groups", PlistDict{{"x", "y"}}}}));

    TarnCountedSet app = mapping().copyReferenceCountSetOfType(TarnGroupTypeApplication);
    EXPECT_EQ(app.countForObject("g.shared"), 3u);
    EXPECT_EQ(app.countForObject("g.a"), 2u);
    EXPECT_EQ(app.countForObject("g.never"), 0u);
    EXPECT_EQ(app.count(), 2u);

    TarnCountedSet system = mapping().copyReferenceCountSetOfType(TarnGroupTypeSystem);
    EXPECT_EQ(system.countForObject("systemgroup.s"), 2u);
    // Counting does not filter by prefix.
    EXPECT_EQ(system.countForObject("unprefixed"), 1u);

    app.removeObject("g.a");
    EXPECT_EQ(app.countForObject("g.a"), 1u);
    app.removeObject("g.a");
    app.removeObject("g.a");
    EXPECT_EQ(app.countForObject("g.a"), 0u);
    EXPECT_EQ(app.count(), 1u);
}

TEST_F(TarnCodeSigningMappingTest, LegacyMappingFileIsImportedOnce) {
    // Missing file: nothing happens.
    mapping_ = makeMapping();
    EXPECT_TRUE(identifiers().empty());
    mapping_.reset();

    const std::string file = std::string(kLibrary) + "/tarn_code_signing_info.plist";
    TarnCodeSigningEntry good(PlistDict{{kTarnEntitlementsKey, PlistDict{{"k", "v"}}}}, 2);
    good.setChildBundleIdentifiers({"com.good.kid"});
    good.setRegisteredByCaller(true);
    PlistDict legacy{
        {"com.good", good.serialize()},
        {"com.noinfo", PlistDict{{"Invalid", true}}},  // nothing to store: refused
        {"com.junk", "not a dictionary"},
    };
    root_.writeFile(file, [&] {
        auto bytes = PlistValue(legacy).toBinary();
        return std::string(bytes.begin(), bytes.end());
    }());
    mapping_ = makeMapping();
    TarnCodeSigningEntryRef back = storedEntry("com.good");
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, good);
    EXPECT_EQ(identifiers(), std::set<std::string>{"com.good"});
    EXPECT_FALSE(std::filesystem::exists(root_.at(file)));
    mapping_.reset();

    // A file none of whose entries could be stored stays for the next start.
    root_.writeFile(file, [] {
        auto bytes = PlistValue(PlistDict{{"com.junk", "x"}}).toBinary();
        return std::string(bytes.begin(), bytes.end());
    }());
    mapping_ = makeMapping();
    EXPECT_TRUE(std::filesystem::exists(root_.at(file)));
    mapping_.reset();

    // An unreadable file is left alone and does not stop the mapping.
    root_.writeFile(file, "garbage");
    mapping_ = makeMapping();
    EXPECT_TRUE(std::filesystem::exists(root_.at(file)));
    EXPECT_TRUE(storedEntry("com.good"));
}

TEST_F(TarnCodeSigningMappingTest, GetCodeSigningInfoCommand) {
    PlistDict info{{kTarnEntitlementsKey, PlistDict{{"k", "v"}}}, {"Extra", uint64_t{1}}};
    store("com.app", std::make_shared<TarnCodeSigningEntry>(info, 2));
    store("com.placeholder", entryWith({}, 2, [](auto& e) { e.setPlaceholder(true); }));

    struct Case {
        PlistValue request;
        uint64_t code;
    };
    const Case cases[] = {
        {PlistDict{{"Identifier", "com.app"}}, TarnSuccess},
        {PlistDict{{"Identifier", "com.placeholder"}}, TarnErrorNotFound},
        {PlistDict{{"Identifier", "com.unknown"}}, TarnErrorNotFound},
        {PlistDict{{"Identifier", uint64_t{7}}}, TarnErrorNotFound},
        {PlistDict{}, TarnErrorNotFound},
    };
    for (const Case& c : cases) {
        PlistValue reply{PlistDict{}};
        uint64_t error = TarnSuccess;
        TarnHandleGetCodeSigningInfoCommand({}, c.request, reply, nullptr, &error);
        EXPECT_EQ(error, c.code) << c.request.description();
        if (c.code == TarnSuccess) {
            ASSERT_TRUE(reply.find("ReplyInfoDictionary"));
            EXPECT_EQ(*reply.find("ReplyInfoDictionary"), PlistValue(info));
        } else {
            EXPECT_FALSE(reply.find("ReplyInfoDictionary"));
        }
    }
}

TEST_F(TarnCodeSigningMappingTest, BatchWriteDeletesStoresAndChecksCounts) {
    store("com.gone", entryWith({}));
    auto kept = entryWith({{"k", "v"}});
    TarnStatus written;
    mapping().queue()->sync([&] {
        written = mapping()._onQueue_setCodeSigningDictionaryValues({kept}, {"com.a", "com.b"});
    });
    EXPECT_EQ(written.code(TarnSuccess), TarnErrorMismatchedInput);
    mapping().queue()->sync([&] {
        written = mapping()._onQueue_setCodeSigningDictionaryValues(
            {std::make_shared<TarnCodeSigningEntry>(), kept,
             std::make_shared<TarnCodeSigningEntry>()},
            {"com.gone", "com.kept", "com.never"});
    });
    EXPECT_TRUE(written.ok());
    EXPECT_EQ(identifiers(), std::set<std::string>{"com.kept"});
}

// ---- processing ----

TEST_F(TarnCodeSigningMappingTest, SameInfoTwiceWritesOnceAndDroppedSystemContainerIsStagedOnce) {
    countStoreWrites();
    const PlistDict withSystem{{"com.ostrea.security.system-container", true},
                               {"com.ostrea.security.application-groups", "group.a"}};
    const PlistDict withoutSystem{{"com.ostrea.security.application-groups", "group.a"}};
    const PlistDict options{{TarnCodeSigningMapping::kOptionDataContainerClass, uint64_t{2}}};
    int handOvers = 0;
    mapping().TEST_groupChangeHook = [&](const auto&, const auto&, TarnGroupType) { ++handOvers; };

    ASSERT_TRUE(process("com.sys", infoWith(withSystem), options).ok());
    EXPECT_EQ(writes_, 1);
    EXPECT_TRUE(staged().empty());
    EXPECT_EQ(mapping().dataContainerTypeForIdentifier("com.sys"), 2u);

    ASSERT_TRUE(process("com.sys", infoWith(withoutSystem), options).ok());
    EXPECT_EQ(writes_, 2);
    EXPECT_EQ(staged(), std::vector<std::string>{"com.sys/12"});
    EXPECT_EQ(handOvers, 2);

    // Nothing changed: no write, nothing staged, nothing handed to the group rules.
    ASSERT_TRUE(process("com.sys", infoWith(withoutSystem), options).ok());
    EXPECT_EQ(writes_, 2);
    EXPECT_EQ(staged().size(), 1u);
    EXPECT_EQ(handOvers, 2);

    EXPECT_EQ(process("", infoWith(withoutSystem)).code(TarnSuccess), TarnErrorMissingIdentifier);
}

TEST_F(TarnCodeSigningMappingTest, ChildIsAddedToItsParentOnce) {
    const PlistDict child{{TarnCodeSigningMapping::kOptionParentBundleID, "com.app"},
                          {TarnCodeSigningMapping::kOptionDataContainerClass, uint64_t{4}}};
    ASSERT_TRUE(process("com.app", infoWith({{"k", "app"}})).ok());
    ASSERT_TRUE(process("com.app.ext", infoWith({{"k", "ext"}}), child).ok());
    EXPECT_EQ(mapping().childBundleIdentifiersForParentIdentifier("com.app"),
              std::vector<std::string>{"com.app.ext"});
    EXPECT_EQ(mapping().parentIdentifierForChildIdentifier("com.app.ext"), "com.app");

    countStoreWrites();
    ASSERT_TRUE(process("com.app.ext", infoWith({{"k", "ext"}}), child).ok());
    EXPECT_EQ(writes_, 0);
    EXPECT_EQ(mapping().childBundleIdentifiersForParentIdentifier("com.app"),
              std::vector<std::string>{"com.app.ext"});

    // A parent with children never equals new info (which lists none), so it
    // is written again; its children stay.
    ASSERT_TRUE(process("com.app", infoWith({{"k", "app"}})).ok());
    EXPECT_EQ(writes_, 1);
    EXPECT_EQ(mapping().childBundleIdentifiersForParentIdentifier("com.app"),
              std::vector<std::string>{"com.app.ext"});

    // A parent without a record is not made up for its child.
    ASSERT_TRUE(process("com.orphan.ext", infoWith({}),
                        {{TarnCodeSigningMapping::kOptionParentBundleID, "com.nobody"}})
                    .ok());
    EXPECT_EQ(identifiers(), (std::set<std::string>{"com.app", "com.app.ext", "com.orphan.ext"}));
    EXPECT_EQ(mapping().parentIdentifierForChildIdentifier("com.orphan.ext"), "");
}

TEST_F(TarnCodeSigningMappingTest, RemovingAParentRemovesItsChildrenFirstThroughProcessing) {
    const PlistDict system{{"com.ostrea.security.system-container", true}};
    ASSERT_TRUE(process("com.p", infoWith(system)).ok());
    for (const char* kid : {"com.p.one", "com.p.two"}) {
        ASSERT_TRUE(process(kid, infoWith(system),
                            {{TarnCodeSigningMapping::kOptionParentBundleID, "com.p"}})
                        .ok());
    }
    ASSERT_TRUE(process("com.other", infoWith(system)).ok());
    ASSERT_TRUE(staged().empty());

    mapping().removeCodeSigningDictionariesForIdentifierAndItsChildren("com.p", &commands_);
    EXPECT_EQ(identifiers(), std::set<std::string>{"com.other"});
    // Each removal is a processing of its own: every system container the
    // removed entries claimed is staged, the children's before the parent's.
    EXPECT_EQ(staged(), (std::vector<std::string>{"com.p.one/12", "com.p.two/12", "com.p/12"}));

    // Unknown identifiers are nothing to remove.
    mapping().removeCodeSigningDictionariesForIdentifierAndItsChildren("com.unknown", &commands_);
    mapping().removeCodeSigningDictionariesForIdentifierAndItsChildren("", &commands_);
    EXPECT_EQ(staged().size(), 3u);
    EXPECT_EQ(identifiers(), std::set<std::string>{"com.other"});
}

TEST_F(TarnCodeSigningMappingTest, MalformedGroupValuesAreIgnoredWhenHandedToTheGroupRules) {
    using Ids = std::optional<std::vector<std::string>>;
    std::vector<std::pair<Ids, Ids>> seen;  // (old, new), app groups first
    mapping().TEST_groupChangeHook = [&](const Ids& oldIds, const Ids& newIds, TarnGroupType) {
        seen.emplace_back(oldIds, newIds);
    };
    ASSERT_TRUE(process("com.a", infoWith({{"com.ostrea.security.application-groups",
                                            PlistArray{"g.a", "g.b"}},
                                           {"com.ostrea.security.system-groups",
                                            PlistArray{"systemgroup.a", "unprefixed"}}}))
                    .ok());
    // A list holding a non-string counts as no list; the older system-group
    // key is read when the current one is empty; the old system list keeps
    // only prefixed names.
    seen.clear();
    ASSERT_TRUE(
        process(
            "com.a",
            infoWith({{"com.ostrea.security.application-groups", PlistArray{"g.a", uint64_t{7}}},
                      {"com.ostrea.security.system-groups", PlistArray{}},
                      {"com.ostrea.security.system-group-containers", "systemgroup.b"}}))
            .ok());
    EXPECT_EQ(seen,
              (std::vector<std::pair<Ids, Ids>>{{Ids({"g.a", "g.b"}), std::nullopt},
                                                {Ids({"systemgroup.a"}), Ids({"systemgroup.b"})}}));
}

TEST_F(TarnCodeSigningMappingTest, ExceptionWhileProcessingIsFencedAndWritesNothing) {
    TarnGlobalConfiguration::sharedInstance().setIsInternalImage(false);
    countStoreWrites();
    mapping().TEST_groupChangeHook = [](const auto&, const auto&, TarnGroupType) {
        throw std::runtime_error("boom");
    };
    EXPECT_EQ(process("com.a", infoWith({{"com.ostrea.security.application-groups", "g.a"}}))
                  .code(TarnSuccess),
              TarnErrorException);
    EXPECT_EQ(writes_, 0);
    mapping().TEST_groupChangeHook = nullptr;
    EXPECT_TRUE(
        process("com.a", infoWith({{"com.ostrea.security.application-groups", "g.a"}})).ok());
    EXPECT_EQ(writes_, 1);
}

// ---- caller-registered entitlements ----

class TarnCallerRegistrationTest : public TarnCodeSigningMappingTest {
protected:
    TarnStatus registerSelf(const std::string& id, const PlistDict& entitlements) {
        return mapping().processCallerRegisteredEntitlements(entitlements, id, &commands_);
    }

    // Runs a registration on another thread while this one holds the global
    // write lock (and, with `suspendQueue`, keeps the mapping's queue from
    // running anything); answers whether it finished within `wait`. Both are
    // let go before returning, so a registration that waited finishes too.
    bool finishesWhileHeld(const std::string& id, const PlistDict& entitlements, bool suspendQueue,
                           std::chrono::milliseconds wait) {
        gTarnLocks.write_lock_all_identifiers();
        if (suspendQueue) mapping().queue()->suspend();
        auto done = std::async(std::launch::async, [&] { return registerSelf(id, entitlements); });
        const bool finished = done.wait_for(wait) == std::future_status::ready;
        if (suspendQueue) mapping().queue()->resume();
        gTarnLocks.unlock_all_identifiers();
        EXPECT_TRUE(done.get().ok());
        return finished;
    }

    const PlistDict e1_{{"com.ostrea.security.application-groups", PlistArray{"g.one"}},
                        {"k", "v1"}};
    const PlistDict e2_{{"com.ostrea.security.application-groups", PlistArray{"g.one"}},
                        {"k", "v2"}};
};

TEST_F(TarnCallerRegistrationTest, InstallerInfoIsNeverReplaced) {
    ASSERT_TRUE(process("com.inst", infoWith(e1_)).ok());
    countStoreWrites();
    ASSERT_TRUE(registerSelf("com.inst", e2_).ok());
    // Once found installer-owned, answered without the lock or the queue.
    EXPECT_TRUE(
        finishesWhileHeld("com.inst", e2_, /*suspendQueue=*/true, std::chrono::seconds(10)));
    EXPECT_EQ(writes_, 0);
    EXPECT_FALSE(storedEntry("com.inst")->registeredByCaller());
    EXPECT_EQ(mapping().entitlementsForIdentifier("com.inst"), e1_);
    EXPECT_EQ(registerSelf("", e1_).code(TarnSuccess), TarnErrorMissingIdentifier);
}

TEST_F(TarnCallerRegistrationTest, IdenticalRegistrationIsFreeAndAChangeReRegisters) {
    countStoreWrites();
    ASSERT_TRUE(registerSelf("com.self", e1_).ok());
    EXPECT_EQ(writes_, 1);
    EXPECT_TRUE(mapping().identifierHasCallerRegisteredEntitlements("com.self"));
    EXPECT_EQ(mapping().entitlementsForIdentifier("com.self"), e1_);

    // The same again: no write and no lock; once found registered it is not
    // even looked up (the queue is held still).
    EXPECT_TRUE(
        finishesWhileHeld("com.self", e1_, /*suspendQueue=*/false, std::chrono::seconds(10)));
    EXPECT_TRUE(
        finishesWhileHeld("com.self", e1_, /*suspendQueue=*/true, std::chrono::seconds(10)));
    EXPECT_EQ(writes_, 1);

    // Changed entitlements wait for the global write lock, then re-register.
    EXPECT_FALSE(
        finishesWhileHeld("com.self", e2_, /*suspendQueue=*/false, std::chrono::milliseconds(200)));
    EXPECT_EQ(writes_, 2);
    EXPECT_EQ(mapping().entitlementsForIdentifier("com.self"), e2_);
    EXPECT_TRUE(mapping().identifierHasCallerRegisteredEntitlements("com.self"));

    // What was remembered no longer holds once the store changed: a removed
    // registration is made again.
    ASSERT_TRUE(registerSelf("com.self", e2_).ok());
    EXPECT_EQ(writes_, 2);
    mapping().removeCodeSigningDictionariesForIdentifierAndItsChildren("com.self", &commands_);
    ASSERT_TRUE(registerSelf("com.self", e2_).ok());
    EXPECT_EQ(writes_, 3);
    EXPECT_EQ(mapping().entitlementsForIdentifier("com.self"), e2_);
}

// ---- invalidation and import from bundle containers ----

TEST_F(TarnCodeSigningMappingTest, AppsWithoutBundleContainerAreInvalidated) {
    makeBundleContainer(1, "com.app");
    makeBundleContainer(5, "com.vpn");
    store("com.app",
          entryWith({}, 2, [](auto& e) { e.setChildBundleIdentifiers({"com.app.ext"}); }));
    store("com.app.ext", entryWith({}, 4));
    store("com.vpn", entryWith({}, 6));
    store("com.caller", entryWith({}, 0, [](auto& e) { e.setRegisteredByCaller(true); }));
    store("com.gone",
          entryWith({}, 2, [](auto& e) { e.setChildBundleIdentifiers({"com.gone.ext"}); }));
    store("com.gone.ext", entryWith({}, 4));
    store("com.lone.ext", entryWith({}, 4));

    ASSERT_TRUE(mapping().invalidateCodeSigningInfoForAppsWithoutBundleContainer().ok());
    for (const char* kept : {"com.app", "com.app.ext", "com.vpn", "com.caller"}) {
        EXPECT_FALSE(storedEntry(kept)->invalid()) << kept;
    }
    // A plug-in with a parent is not judged on its own, but goes with a parent
    // that is invalidated.
    for (const char* gone : {"com.gone", "com.gone.ext", "com.lone.ext"}) {
        EXPECT_TRUE(storedEntry(gone)->invalid()) << gone;
    }
    EXPECT_FALSE(mapping().getCodeSigningInfoForIdentifier("com.gone"));
    // The global write lock is released.
    EXPECT_EQ(gTarnLocks.TEST_allReaderWriterState(), 0);
}

TEST_F(TarnCodeSigningMappingTest, MissImportsCachedInfoFromTheBundleContainerOnce) {
    const PlistDict entitlements{{"com.ostrea.security.application-groups", "group.x"}};
    makeBundleContainer(1, "com.cached",
                        PlistDict{{kTarnInfoCachedCodeSigningInfoKey,
                                   PlistDict{{"Entitlements", entitlements}, {"Other", "kept"}}}});
    makeBundleContainer(1, "com.notdict", PlistDict{{kTarnInfoCachedCodeSigningInfoKey, "junk"}});
    countStoreWrites();

    EXPECT_EQ(mapping().entitlementsForIdentifier("com.cached"), entitlements);
    EXPECT_EQ(mapping().entitlementsForIdentifier("com.cached"), entitlements);
    EXPECT_EQ(mapping().appGroupIdentifiersForIdentifier("com.cached"),
              std::optional<std::vector<std::string>>({"group.x"}));
    EXPECT_EQ(writes_, 1);
    TarnCodeSigningEntryRef imported = storedEntry("com.cached");
    ASSERT_TRUE(imported);
    EXPECT_EQ(imported->dataContainerClass(), 2u);
    EXPECT_EQ(*imported->codeSigningInfo(), (PlistDict{{"Entitlements", entitlements},
                                                       {"Other", "kept"},
                                                       {kTarnEntitlementsKey, entitlements}}));

    EXPECT_FALSE(mapping().entitlementsForIdentifier("com.notdict"));
    EXPECT_FALSE(mapping().entitlementsForIdentifier("com.nobundle"));
    EXPECT_EQ(writes_, 1);
    EXPECT_EQ(identifiers(), std::set<std::string>{"com.cached"});
}

// Misuse of the queue is a programming error, caught in every build.
TEST_F(TarnCodeSigningMappingTest, OnQueueOperationsOffTheQueueStopTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(mapping()._onQueue_dataContainerTypeForIdentifier("com.a"),
                 "off the mapping's queue");
}

}  // namespace
}  // namespace tarn
