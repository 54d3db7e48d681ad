#include "Daemon/TarnContainerIdentity.h"

#include <gtest/gtest.h>

#include <fstream>
#include <sstream>

#include "Daemon/TarnError.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/PlatformLog.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

class TarnContainerIdentityTest : public test::ScratchRootTest {
protected:
    void SetUp() override { TarnUserIdentityCache::TEST_setPersonasAreSupported(false); }
    void TearDown() override { TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt); }

    TarnUserIdentityRef user(uint32_t uid, uint32_t type = TarnPersonaTypePersonal,
                             std::optional<std::string> persona = std::nullopt) {
        return TarnUserIdentity::initWithUID(uid, uid, root_.at("/private/var/mobile"), persona,
                                             type, uid);
    }
};

// The code of a construction's refusal; TarnSuccess when it made an identity.
template <class Ref>
uint64_t refusal(const TarnResult<Ref>& made) {
    if (made.ok()) EXPECT_TRUE(*made) << "a made identity is never empty";
    return made.code(TarnSuccess);
}

TEST_F(TarnContainerIdentityTest, ValidationCodesInOrder) {
    EXPECT_EQ(
        refusal(TarnContainerIdentity::containerIdentityWithUserIdentity(nullptr, std::nullopt, 0)),
        TarnErrorInvalidArgument)
        << "no user identity is checked first";
    EXPECT_EQ(refusal(TarnContainerIdentity::containerIdentityWithUserIdentity(user(501),
                                                                               std::nullopt, 99)),
              TarnErrorMissingIdentifier)
        << "missing identifier before the class";

    PlistValue number(uint64_t{7});
    EXPECT_EQ(
        refusal(TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), &number, 2)),
        TarnErrorInvalidArgument);
    PlistValue null;
    EXPECT_EQ(
        refusal(TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), &null, 2)),
        TarnErrorMissingIdentifier);

    for (TarnContainerClass bad : {TarnContainerClass{0}, TarnContainerClass{14},
                                   TarnContainerClass{1000}}) {
        EXPECT_EQ(
            refusal(TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), "a", bad)),
            TarnErrorInvalidArgument)
            << bad;
    }
    for (TarnContainerClass good : {TarnContainerClass{1}, TarnContainerClass{13}}) {
        EXPECT_EQ(
            refusal(TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), "", good)),
            TarnSuccess)
            << "an empty identifier passes";
    }
}

// A refusal is reported once, by the line that says why; the error value
// handed back is silent, so that callers passing it on log nothing twice.
TEST_F(TarnContainerIdentityTest, ARefusalIsLoggedOnce) {
    PlatformLogSetQuiet(true);
    const FileURL logPath = root_.at("/platform.log");
    PlatformLogSetFile(logPath);
    auto refused = TarnConcreteContainerIdentity::containerIdentityWithUUID(std::nullopt, user(501),
                                                                            "com.x", 2);
    auto missing =
        TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), std::nullopt, 2);
    auto global = TarnContainerIdentity::containerIdentityWithIdentifier("com.x", 2);
    PlatformLogSetFile("");
    std::stringstream log;
    log << std::ifstream(logPath).rdbuf();
    const std::string text = log.str();
    auto count = [&](const std::string& needle) {
        size_t n = 0;
        for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1))
            ++n;
        return n;
    };
    EXPECT_EQ(count("Invalid object: uuid = [(null)]"), 1u) << text;
    EXPECT_EQ(count("Invalid object: missing identifier"), 1u) << text;
    EXPECT_EQ(count("Attempt to create a container identity without a user identity"), 1u) << text;
    EXPECT_EQ(count("\n"), 3u) << text;
    for (const TarnErrorRef& e : {refused.error(), missing.error(), global.error()}) {
        ASSERT_TRUE(e);
        EXPECT_FALSE(e->localizedDescription()) << e->description();
    }
}

TEST_F(TarnContainerIdentityTest, WithoutUserIdentityOnlyForGlobalClasses) {
    EXPECT_EQ(refusal(TarnContainerIdentity::containerIdentityWithIdentifier("com.x", 2)),
              TarnErrorInvalidArgument);
    for (TarnContainerClass c : {TarnContainerClass{1}, TarnContainerClass{12}}) {
        auto id = TarnContainerIdentity::containerIdentityWithIdentifier("com.x", c).value();
        EXPECT_TRUE(id->userIdentity()->isEqual(*TarnUserIdentityCache::defaultUserIdentity()));
        EXPECT_EQ(id->userIdentity()->posixUID(), 501u);
    }
}

TEST_F(TarnContainerIdentityTest, ConcreteRefusesAStringUUID) {
    PlistValue text(Uuid::generate().string());
    PlistValue identifier("com.x");
    EXPECT_EQ(refusal(TarnConcreteContainerIdentity::containerIdentityWithUUID(&text, user(501),
                                                                               &identifier, 2)),
              TarnErrorInvalidArgument);
    EXPECT_EQ(refusal(TarnConcreteContainerIdentity::containerIdentityWithUUID(
                  std::nullopt, user(501), "com.x", 2)),
              TarnErrorInvalidArgument);
    // Base checks come first and pass their code through.
    EXPECT_EQ(refusal(TarnConcreteContainerIdentity::containerIdentityWithUUID(&text, user(501),
                                                                               nullptr, 2)),
              TarnErrorMissingIdentifier);
}

TEST_F(TarnContainerIdentityTest, EqualityIsByUserIdentifierAndAsymmetricForConcrete) {
    auto plain = [](TarnUserIdentityRef u) {
        return TarnContainerIdentity::containerIdentityWithUserIdentity(std::move(u), "com.x", 2)
            .value();
    };
    auto concreteWith = [](Uuid uuid, TarnUserIdentityRef u) {
        return TarnConcreteContainerIdentity::containerIdentityWithUUID(uuid, std::move(u), "com.x",
                                                                        2)
            .value();
    };
    auto personal = user(501);
    auto unspecific = user(501, TarnPersonaTypeUnspecific);
    auto a = plain(personal);
    auto b = plain(unspecific);
    EXPECT_TRUE(a->isEqual(*b));
    EXPECT_EQ(a->hash(), b->hash());

    auto other = plain(user(502));
    EXPECT_FALSE(a->isEqual(*other));
    auto e = plain(user(501, TarnPersonaTypeEnterprise, "ENT-1"));
    EXPECT_FALSE(a->isEqual(*e)) << "an enterprise persona is keyed by its unique string";

    Uuid uuid = Uuid::generate();
    auto c1 = concreteWith(uuid, personal);
    auto c2 = concreteWith(uuid, unspecific);
    auto c3 = concreteWith(Uuid::generate(), personal);
    EXPECT_TRUE(a->isEqual(*c1)) << "plain equals concrete with the same fields";
    EXPECT_FALSE(c1->isEqual(*a)) << "but not the other way round";
    EXPECT_TRUE(c1->isEqual(*c2));
    EXPECT_EQ(c1->hash(), c2->hash());
    EXPECT_FALSE(c1->isEqual(*c3));

    // Usable as map keys, one kind at a time.
    TarnContainerIdentityMap<int> byIdentity;
    byIdentity[a] = 1;
    byIdentity[b] = 2;
    byIdentity[other] = 3;
    EXPECT_EQ(byIdentity.size(), 2u);
    EXPECT_EQ(byIdentity[a], 2);
    TarnContainerIdentitySet concrete{c1, c2, c3};
    EXPECT_EQ(concrete.size(), 2u);
}

TEST_F(TarnContainerIdentityTest, ClassTable) {
    EXPECT_STREQ(TarnContainerClassRelativeDirectory(2), "Data/Application");
    EXPECT_STREQ(TarnContainerClassRelativeDirectory(13), "Shared/SystemGroup");
    EXPECT_EQ(TarnContainerClassRelativeDirectory(0), nullptr);
    EXPECT_EQ(TarnContainerClassRelativeDirectory(14), nullptr);
    EXPECT_STREQ(TarnContainerClassShortName(0), "Undefined");
    EXPECT_STREQ(TarnContainerClassShortName(14), "MAX");
    EXPECT_EQ(TarnContainerClassShortName(15), nullptr);
    for (TarnContainerClass c = 0; c <= 15; ++c) {
        const bool global = c == 1 || c == 3 || c == 5 || c == 8 || c == 12 || c == 13;
        EXPECT_EQ(TarnUserIdentity::isUserIdentityRequiredForContainerClass(c), !global) << c;
        EXPECT_EQ(TarnContainerClassSandboxItemType(c) == 0,
                  !TarnContainerClassIsValid(c) || TarnContainerClassIsBundle(c))
            << c;
    }
    auto u = user(600);
    EXPECT_EQ(u->posixUIDForContainerClass(1), 33u);
    EXPECT_EQ(u->posixGIDForContainerClass(8), 33u);
    EXPECT_EQ(u->posixUIDForContainerClass(12), 4294967294u);
    EXPECT_EQ(u->posixGIDForContainerClass(13), 4294967294u);
    EXPECT_EQ(u->posixUIDForContainerClass(2), 600u);
    EXPECT_EQ(u->posixGIDForContainerClass(7), 600u);
}

}  // namespace
}  // namespace tarn
