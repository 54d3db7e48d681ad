#include "Daemon/TarnUserIdentity.h"

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <mutex>
#include <thread>

#include "Daemon/TarnError.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/HostConfiguration.h"
#include "Platform/PersonaRoster.h"
#include "Platform/RootPrefix.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

using Kind = PersonaAttributes::Kind;

PersonaAttributesRef persona(Kind kind, std::optional<std::string> unique, uint32_t id,
                             std::vector<std::string> bundles = {},
                             std::optional<std::string> layout = std::nullopt) {
    auto p = std::make_shared<PersonaAttributes>();
    p->kind = kind;
    p->uniqueString = std::move(unique);
    p->personaID = id;
    p->bundleIDs = std::move(bundles);
    p->layoutPath = std::move(layout);
    return p;
}

class RecordingObserver : public TarnUserIdentityCacheObserver {
public:
    void userIdentityCache(TarnUserIdentityCache&, const TarnUserIdentityRef& identity) override {
        invalidated.push_back(identity);
    }
    std::vector<TarnUserIdentityRef> invalidated;
};

// A cache over an in-memory roster, with personas switched on or off.
class TarnUserIdentityCacheTest : public test::ScratchRootTest {
protected:
    void SetUp() override { TarnUserIdentityCache::TEST_setPersonasAreSupported(true); }
    void TearDown() override { TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt); }

    std::unique_ptr<TarnUserIdentityCache> makeCache() {
        auto cache = std::make_unique<TarnUserIdentityCache>(roster_);
        cache->TEST_setRetryDelay(std::chrono::milliseconds(0));
        return cache;
    }

    // Personal P-1 (id 1000), an enterprise persona with its own app and
    // layout, and a universal persona whose apps every identity shares.
    void setStandardList() {
        roster_.setList(PersonaAttributesList{
            persona(Kind::Personal, "P-1", 1000),
            persona(Kind::Universal, "U-1", 1001, {"com.ostrea.shared"}),
            persona(Kind::Enterprise, "E-1", 1002, {"com.corp.mail"}, root_.at("/private/var/ent1")),
            persona(Kind::Enterprise, "E-2", 1003, {}, std::nullopt),
            persona(Kind::System, std::nullopt, 1004, {"com.ostrea.sys"}),
        });
    }

    MemoryPersonaRoster roster_;
};

TEST(TarnUserIdentityTest, IdentifierRuleAndRoleUsers) {
    test::ScratchRoot root;
    EXPECT_EQ(TarnUserIdentity::_identifierForPOSIXUID(501, "E", TarnPersonaTypeEnterprise), "E");
    EXPECT_EQ(TarnUserIdentity::_identifierForPOSIXUID(501, "P", TarnPersonaTypePersonal), "501");
    EXPECT_EQ(TarnUserIdentity::_identifierForPOSIXUID(501, std::nullopt, TarnPersonaTypeEnterprise),
              "501");
    EXPECT_FALSE(TarnUserIdentity::initWithUID(500, 500, "/h", std::nullopt, 0, 500));
    EXPECT_FALSE(TarnUserIdentity::initWithUID(0, 0, "/h", std::nullopt, 0, 0));
    auto u = TarnUserIdentity::init();
    ASSERT_TRUE(u);
    EXPECT_EQ(u->identifier(), "501");
    EXPECT_EQ(u->homeDirectoryURL(), root.at("/private/var/mobile"));

    // Personal and unspecific of one user collapse in a set.
    TarnUserIdentitySet set{u, TarnUserIdentity::initWithUID(501, 501, "/x", "P", 2, 7)};
    EXPECT_EQ(set.size(), 1u);
}

TEST_F(TarnUserIdentityCacheTest, StoredIdentitiesVersionsAndMalformedData) {
    TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
    auto cache = makeCache();

    auto v2 = TarnUserIdentity::initWithUID(501, 501, "/h", std::nullopt, 0, 501)->plist();
    EXPECT_EQ(*v2.find("version")->asString(), "2");
    EXPECT_EQ(v2.find("personaUniqueString"), nullptr);
    auto read = TarnUserIdentity::userIdentityWithPlist(v2, *cache).value();
    ASSERT_TRUE(read);
    EXPECT_EQ(read->identifier(), "501");
    EXPECT_EQ(read->homeDirectoryURL(), root_.at("/private/var/mobile"))
        << "the home directory comes from the cache, never from the file";

    PlistDict v1{{"posixUID", PlistValue(uint64_t{502})},
                 {"posixGID", PlistValue(uint64_t{502})},
                 {"version", PlistValue("1")},
                 {"personaIdentifier", PlistValue("whatever")}};
    read = TarnUserIdentity::userIdentityWithPlist(PlistValue(v1), *cache).value();
    ASSERT_TRUE(read);
    EXPECT_EQ(read->posixUID(), 502u);

    auto expectMalformed = [&](PlistValue value, const char* why) {
        EXPECT_EQ(TarnUserIdentity::userIdentityWithPlist(value, *cache).code(TarnSuccess),
                  TarnErrorInvalidUserIdentityData)
            << why;
    };
    PlistValue numberVersion = v2;
    numberVersion.set("version", PlistValue(uint64_t{2}));
    expectMalformed(numberVersion, "version as a number is not version 2");
    PlistValue stringUID = v2;
    stringUID.set("posixUID", PlistValue("501"));
    expectMalformed(stringUID, "uid as a string");
    PlistValue noGID = v2;
    noGID.erase("posixGID");
    expectMalformed(noGID, "missing gid");
    PlistValue badType = v2;
    badType.set("type", PlistValue(uint64_t{3}));
    expectMalformed(badType, "type 3");
    PlistValue negative = v2;
    negative.set("posixUID", PlistValue(int64_t{-1}));
    expectMalformed(negative, "negative uid");
    expectMalformed(PlistValue(PlistArray{}), "not a dictionary");
    PlistValue v1StringGID(v1);
    v1StringGID.set("posixGID", PlistValue("x"));
    expectMalformed(v1StringGID, "version 1 checks numbers too");
}

TEST_F(TarnUserIdentityCacheTest, StoredEnterpriseIdentityResolvesThroughTheCache) {
    setStandardList();
    auto cache = makeCache();
    PlistDict stored{{"posixUID", PlistValue(uint64_t{501})},
                     {"posixGID", PlistValue(uint64_t{501})},
                     {"type", PlistValue(uint64_t{1})},
                     {"version", PlistValue("2")},
                     {"personaUniqueString", PlistValue("E-1")}};
    auto e = TarnUserIdentity::userIdentityWithPlist(PlistValue(stored), *cache).value();
    ASSERT_TRUE(e);
    EXPECT_TRUE(e->isEnterprise());
    EXPECT_EQ(e->homeDirectoryURL(), root_.at("/private/var/ent1"));
    EXPECT_EQ(e->kernelPersonaID(), 1002u);

    // Unknown persona: nothing, and no failure of the data.
    stored["personaUniqueString"] = PlistValue("gone");
    TarnResult<TarnUserIdentityRef> gone =
        TarnUserIdentity::userIdentityWithPlist(PlistValue(stored), *cache);
    ASSERT_TRUE(gone.ok());
    EXPECT_FALSE(*gone);

    // A type-1 record whose persona is now universal is used all the same.
    stored["personaUniqueString"] = PlistValue("U-1");
    auto u = TarnUserIdentity::userIdentityWithPlist(PlistValue(stored), *cache).value();
    ASSERT_TRUE(u);
    EXPECT_TRUE(u->isNoSpecificPersona());
}

TEST_F(TarnUserIdentityCacheTest, RebuildFromPersonalOnlyList) {
    roster_.setList(PersonaAttributesList{persona(Kind::Personal, "P-1", 1000)});
    auto cache = makeCache();
    int calls = 0;
    cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const TarnUserIdentityRef& u) {
            ++calls;
            EXPECT_EQ(u->personaType(), TarnPersonaTypePersonal);
        });
    EXPECT_EQ(calls, 1);
    auto p = cache->userIdentityForPersonalPersona();
    auto u = cache->unspecificUserIdentity();
    EXPECT_EQ(p->kernelPersonaID(), 1000u);
    EXPECT_EQ(p->personaUniqueString(), "P-1");
    EXPECT_TRUE(u->isNoSpecificPersona());
    EXPECT_TRUE(p->isEqual(*u));
    EXPECT_TRUE(cache->userIdentityWithPersonaID(1000));
    EXPECT_FALSE(cache->userIdentityWithPersonaID(1001));
    auto owners = cache->userIdentitiesForBundleIdentifier("com.anything");
    ASSERT_EQ(owners.size(), 1u);
    EXPECT_EQ((*owners.begin())->personaType(), TarnPersonaTypePersonal);
}

TEST_F(TarnUserIdentityCacheTest, RebuildWithEnterpriseAndSharedBundles) {
    setStandardList();
    auto cache = makeCache();
    auto e1 = cache->userIdentityForCurrentUserWithPersonaUniqueString("E-1");
    auto e2 = cache->userIdentityForCurrentUserWithPersonaUniqueString("E-2");
    ASSERT_TRUE(e1 && e2);
    EXPECT_EQ(e1->identifier(), "E-1");
    EXPECT_EQ(e1->homeDirectoryURL(), root_.at("/private/var/ent1"));
    EXPECT_TRUE(e2->isEnterprise()) << "no layout path still gives an enterprise identity";
    EXPECT_EQ(e2->homeDirectoryURL(), root_.at("/private/var/mobile"));
    auto universal = cache->userIdentityForCurrentUserWithPersonaUniqueString("U-1");
    ASSERT_TRUE(universal);
    EXPECT_TRUE(universal->isNoSpecificPersona());
    EXPECT_TRUE(cache->userIdentityWithPersonaID(1004)->isNoSpecificPersona())
        << "a system persona without unique string is mapped by id";

    auto personal = cache->userIdentityForPersonalPersona();
    // An enterprise app belongs to its persona only.
    auto mail = cache->userIdentitiesForBundleIdentifier("com.corp.mail");
    EXPECT_EQ(mail.size(), 1u);
    EXPECT_TRUE(mail.count(e1));
    EXPECT_FALSE(cache->isBundleIdentifier("com.corp.mail", personal));
    // Universal and system apps belong to the personal and every enterprise identity.
    for (const char* b : {"com.ostrea.shared", "com.ostrea.sys"}) {
        auto owners = cache->userIdentitiesForBundleIdentifier(b);
        EXPECT_EQ(owners.size(), 3u) << b;
        EXPECT_TRUE(owners.count(personal) && owners.count(e1) && owners.count(e2)) << b;
    }
    EXPECT_TRUE(cache->isBundleIdentifier("com.unlisted", personal));
    EXPECT_FALSE(cache->isBundleIdentifier("com.unlisted", e1));

    std::set<std::string> seen;
    cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const TarnUserIdentityRef& u) { seen.insert(u->identifier()); });
    EXPECT_EQ(seen, (std::set<std::string>{"501", "E-1", "E-2"}));
}

TEST_F(TarnUserIdentityCacheTest, EnterpriseWithoutUniqueStringIsSkipped) {
    roster_.setList(PersonaAttributesList{
        persona(Kind::Personal, "P-1", 1000),
        persona(Kind::Enterprise, std::nullopt, 1005, {"com.corp.x"}),
    });
    auto cache = makeCache();
    EXPECT_FALSE(cache->userIdentityWithPersonaID(1005));
    EXPECT_EQ(cache->userIdentitiesForBundleIdentifier("com.corp.x").size(), 1u);
}

TEST_F(TarnUserIdentityCacheTest, RetriesUntilAUsableListArrives) {
    auto personalOnly = PersonaAttributesList{persona(Kind::Personal, "P-1", 1000)};
    // Nothing, an empty list, a list without a personal persona, a personal
    // persona without unique string, then a good list.
    roster_.queueAnswers({std::nullopt, PersonaAttributesList{},
                          PersonaAttributesList{persona(Kind::Enterprise, "E-1", 1)},
                          PersonaAttributesList{persona(Kind::Personal, std::nullopt, 1000)}});
    roster_.setList(personalOnly);
    auto cache = makeCache();
    EXPECT_EQ(cache->userIdentityForPersonalPersona()->kernelPersonaID(), 1000u);
    EXPECT_EQ(roster_.fetchCount(), 5u);
    // Built once; later answers come from the maps.
    cache->userIdentityForPersonalPersona();
    EXPECT_EQ(roster_.fetchCount(), 5u);
}

TEST_F(TarnUserIdentityCacheTest, WithoutPersonaSupportTheRosterIsNeverAsked) {
    TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
    roster_.setList(std::nullopt);
    auto cache = makeCache();
    auto p = cache->userIdentityForCurrentContextWithUID(0, 0, std::nullopt);
    ASSERT_TRUE(p);
    EXPECT_EQ(p->posixUID(), 501u) << "role users act for the mobile user";
    EXPECT_TRUE(cache->isBundleIdentifier("com.x", p));
    int calls = 0;
    cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const auto&) { ++calls; });
    EXPECT_EQ(calls, 1);
    EXPECT_EQ(roster_.fetchCount(), 0u);
}

using TarnUserIdentityCacheDeathTest = TarnUserIdentityCacheTest;

TEST_F(TarnUserIdentityCacheDeathTest, EndsTheProcessAfterSixtyOneEmptyFetches) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    roster_.setList(PersonaAttributesList{});
    EXPECT_DEATH(
        {
            auto cache = makeCache();
            cache->userIdentityForPersonalPersona();
        },
        "Could not obtain persona attributes after exhausting retries");
}

TEST_F(TarnUserIdentityCacheTest, FlushNotifiesOncePerEnterpriseIdentity) {
    setStandardList();
    auto cache = makeCache();
    auto observer = std::make_shared<RecordingObserver>();
    cache->addObserver(observer);
    cache->flush();
    EXPECT_TRUE(observer->invalidated.empty()) << "nothing was built yet";

    cache->userIdentityForPersonalPersona();  // builds the maps
    cache->flush();
    std::set<std::string> ids;
    for (const auto& u : observer->invalidated) ids.insert(u->identifier());
    EXPECT_EQ(observer->invalidated.size(), 2u);
    EXPECT_EQ(ids, (std::set<std::string>{"E-1", "E-2"}));

    // The next use rebuilds from the roster's current list.
    roster_.setList(PersonaAttributesList{persona(Kind::Personal, "P-2", 2000)});
    EXPECT_EQ(cache->userIdentityForPersonalPersona()->kernelPersonaID(), 2000u);
    EXPECT_FALSE(cache->userIdentityForCurrentUserWithPersonaUniqueString("E-1"));

    observer->invalidated.clear();
    cache->removeObserver(observer.get());
    setStandardList();
    cache->flush();
    cache->userIdentityForPersonalPersona();
    cache->flush();
    EXPECT_TRUE(observer->invalidated.empty());
}

TEST_F(TarnUserIdentityCacheTest, ChoosesTheIdentityOfTheRequest) {
    setStandardList();
    auto cache = makeCache();
    struct Case {
        std::optional<std::string> current;
        uint32_t uid;
        std::string identifier;
        uint32_t type;
        uint32_t expectedUID;
    };
    const Case cases[] = {
        {std::nullopt, 0, "501", TarnPersonaTypeUnspecific, 501},
        {"P-1", 502, "502", TarnPersonaTypePersonal, 502},
        {"E-1", 501, "E-1", TarnPersonaTypeEnterprise, 501},
        {"U-1", 501, "501", TarnPersonaTypeUnspecific, 501},
        {"unknown", 501, "501", TarnPersonaTypeUnspecific, 501},
    };
    for (const auto& c : cases) {
        auto u = cache->userIdentityForCurrentContextWithUID(c.uid, c.uid, c.current);
        ASSERT_TRUE(u) << c.current.value_or("none");
        EXPECT_EQ(u->identifier(), c.identifier) << c.current.value_or("none");
        EXPECT_EQ(u->personaType(), c.type) << c.current.value_or("none");
        EXPECT_EQ(u->posixUID(), c.expectedUID) << c.current.value_or("none");
    }

    // Adjusting keeps an enterprise home and moves other homes to the new user.
    auto e = cache->userIdentityForPersonaUniqueString("E-1", 700, 700);
    ASSERT_TRUE(e);
    EXPECT_EQ(e->homeDirectoryURL(), root_.at("/private/var/ent1"));
    EXPECT_EQ(e->posixUID(), 700u);
    auto same = cache->userIdentityForPersonaUniqueString("E-1", 501, 501);
    EXPECT_EQ(same.get(), cache->userIdentityForCurrentUserWithPersonaUniqueString("E-1").get())
        << "matching ids return the cached object unchanged";
    EXPECT_FALSE(cache->userIdentityForPersonaUniqueString("nope", 501, 501));
}

TEST_F(TarnUserIdentityCacheTest, RepopulateReplacesTheMaps) {
    setStandardList();
    auto cache = makeCache();
    auto personal = TarnUserIdentity::initWithUID(501, 501, "/h", "P-9", 0, 900);
    auto enterprise = TarnUserIdentity::initWithUID(501, 501, "/e", "E-9", 1, 901);
    cache->flushAndRepopulateWithUserIdentities({enterprise, personal});
    EXPECT_EQ(cache->userIdentityForPersonalPersona().get(), personal.get());
    auto u = cache->unspecificUserIdentity();
    EXPECT_TRUE(u->isNoSpecificPersona());
    EXPECT_EQ(u->kernelPersonaID(), 900u);
    EXPECT_EQ(cache->userIdentityWithPersonaID(901).get(), enterprise.get());
    EXPECT_FALSE(cache->userIdentityForCurrentUserWithPersonaUniqueString("E-1"));
    EXPECT_EQ(roster_.fetchCount(), 0u) << "repopulated maps are valid without the roster";
}

TEST(TarnPersonaSupportTest, DecisionOrder) {
    HostConfiguration host;
    EXPECT_FALSE(TarnUserIdentityCache::computePersonasAreSupported(host)) << "no device support";
    host.deviceSupportsPersonas = true;
    EXPECT_TRUE(TarnUserIdentityCache::computePersonasAreSupported(host));
    host.multiUserFlags = 0x80000000u;
    EXPECT_FALSE(TarnUserIdentityCache::computePersonasAreSupported(host)) << "multi-user mode";
    host.multiUserFlags = 0x1;
    EXPECT_TRUE(TarnUserIdentityCache::computePersonasAreSupported(host));
    host.ephemeralStorage = true;
    EXPECT_FALSE(TarnUserIdentityCache::computePersonasAreSupported(host));
}

// The file-backed roster: parsing, and list changes reaching the cache.
class TarnPersonaRosterTest : public test::ScratchRootTest {
protected:
    std::string listPath() { return root_.at("/etc/tarnkeeper/personas.plist"); }
    void writeList(const PlistValue& list) {
        auto bytes = list.toBinary();
        // Written beside and renamed, as a configuration tool would.
        root_.writeFile("/etc/tarnkeeper/.personas.tmp", std::string(bytes.begin(), bytes.end()));
        std::filesystem::rename(root_.at("/etc/tarnkeeper/.personas.tmp"), listPath());
    }
    static PlistValue entry(const char* type, const char* unique, uint64_t id) {
        PlistDict d{{"Type", PlistValue(type)}, {"PersonaID", PlistValue(id)}};
        if (unique) d["UniqueString"] = PlistValue(unique);
        return PlistValue(std::move(d));
    }
};

TEST_F(TarnPersonaRosterTest, ReadsTheListFileAndRejectsMalformedOnes) {
    std::string why;
    auto list = FilePersonaRoster::readListFile(listPath(), &why);
    ASSERT_TRUE(list) << "a missing file is an empty list";
    EXPECT_TRUE(list->empty());

    PlistValue ent = entry("enterprise", "E-1", 7);
    ent.set("LayoutPath", PlistValue("/private/var/ent"));
    ent.set("BundleIDs", PlistValue(PlistArray{PlistValue("a"), PlistValue("b")}));
    writeList(PlistValue(PlistArray{entry("personal", "P-1", 1), ent, entry("guest", nullptr, 9)}));
    list = FilePersonaRoster::readListFile(listPath(), &why);
    ASSERT_TRUE(list) << why;
    ASSERT_EQ(list->size(), 3u);
    EXPECT_TRUE((*list)[0]->isPersonalPersona());
    EXPECT_EQ((*list)[1]->personaLayoutPathURL(), root_.at("/private/var/ent"));
    EXPECT_EQ((*list)[1]->userPersonaBundleIDList().size(), 2u);
    EXPECT_EQ((*list)[2]->kind, Kind::Other);

    const std::pair<PlistValue, const char*> bad[] = {
        {PlistValue(PlistDict{}), "top level not an array"},
        {PlistValue(PlistArray{PlistValue("x")}), "entry not a dictionary"},
        {PlistValue(PlistArray{entry("personal", "P", uint64_t{1} << 33)}), "id over 32 bits"},
        {PlistValue(PlistArray{PlistValue(PlistDict{{"Type", PlistValue("personal")}})}), "no id"},
    };
    for (const auto& [value, what] : bad) {
        writeList(value);
        EXPECT_FALSE(FilePersonaRoster::readListFile(listPath(), &why)) << what;
    }
    root_.writeFile("/etc/tarnkeeper/personas.plist", "not a plist at all");
    EXPECT_FALSE(FilePersonaRoster::readListFile(listPath(), &why));
}

TEST_F(TarnPersonaRosterTest, ListChangesFlushTheCache) {
    TarnUserIdentityCache::TEST_setPersonasAreSupported(true);
    writeList(PlistValue(PlistArray{entry("personal", "P-1", 1), entry("enterprise", "E-1", 2)}));
    FilePersonaRoster roster(listPath());
    TarnUserIdentityCache cache(roster);
    EXPECT_TRUE(cache.registered());
    ASSERT_TRUE(cache.userIdentityForCurrentUserWithPersonaUniqueString("E-1"));

    auto observer = std::make_shared<RecordingObserver>();
    cache.addObserver(observer);
    writeList(PlistValue(PlistArray{entry("personal", "P-1", 1)}));
    // The watcher runs on its own thread; the flush on the cache's queue.
    for (int i = 0; i < 200 && observer->invalidated.empty(); ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
        cache.TEST_drainFlushQueue();
    }
    ASSERT_EQ(observer->invalidated.size(), 1u);
    EXPECT_EQ(observer->invalidated[0]->identifier(), "E-1");
    EXPECT_FALSE(cache.userIdentityForCurrentUserWithPersonaUniqueString("E-1"));
    TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
}

}  // namespace
}  // namespace tarn
