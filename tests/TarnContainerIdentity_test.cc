#include "Daemon/TarnContainerIdentity.h"

#include <gtest/gtest.h>

#include "Daemon/TarnError.h"
#include "Daemon/TarnUserIdentityCache.h"
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

TEST_F(TarnContainerIdentityTest, ValidationCodesInOrder) {
    uint64_t error = TarnSuccess;
    EXPECT_FALSE(TarnContainerIdentity::containerIdentityWithUserIdentity(nullptr, std::nullopt, 0,
                                                                          &error));
    EXPECT_EQ(error, TarnErrorInvalidArgument) << "no user identity is checked first";

    error = TarnSuccess;
    EXPECT_FALSE(TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), std::nullopt,
                                                                          99, &error));
    EXPECT_EQ(error, TarnErrorMissingIdentifier) << "missing identifier before the class";

    PlistValue number(uint64_t{7});
    error = TarnSuccess;
    EXPECT_FALSE(
        TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), &number, 2, &error));
    EXPECT_EQ(error, TarnErrorInvalidArgument);

    PlistValue null;
    error = TarnSuccess;
    EXPECT_FALSE(TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), &null, 2, &error));
    EXPECT_EQ(error, TarnErrorMissingIdentifier);

    for (TarnContainerClass bad : {TarnContainerClass{0}, TarnContainerClass{14},
                                   TarnContainerClass{1000}}) {
        error = TarnSuccess;
        EXPECT_FALSE(TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), "a", bad,
                                                                              &error));
        EXPECT_EQ(error, TarnErrorInvalidArgument) << bad;
    }
    for (TarnContainerClass good : {TarnContainerClass{1}, TarnContainerClass{13}}) {
        error = TarnSuccess;
        auto id = TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), "", good, &error);
        ASSERT_TRUE(id) << "an empty identifier passes";
        EXPECT_EQ(error, TarnSuccess) << "the slot is written only on failure";
    }
    // A null slot is allowed.
    EXPECT_FALSE(TarnContainerIdentity::containerIdentityWithUserIdentity(user(501), "a", 0, nullptr));
}

TEST_F(TarnContainerIdentityTest, WithoutUserIdentityOnlyForGlobalClasses) {
    uint64_t error = TarnSuccess;
    EXPECT_FALSE(TarnContainerIdentity::containerIdentityWithIdentifier("com.x", 2, &error));
    EXPECT_EQ(error, TarnErrorInvalidArgument);
    for (TarnContainerClass c : {TarnContainerClass{1}, TarnContainerClass{12}}) {
        auto id = TarnContainerIdentity::containerIdentityWithIdentifier("com.x", c, &error);
        ASSERT_TRUE(id);
        EXPECT_TRUE(id->userIdentity()->isEqual(*TarnUserIdentityCache::defaultUserIdentity()));
        EXPECT_EQ(id->userIdentity()->posixUID(), 501u);
    }
}

TEST_F(TarnContainerIdentityTest, ConcreteRefusesAStringUUID) {
    uint64_t error = TarnSuccess;
    PlistValue text(Uuid::generate().string());
    PlistValue identifier("com.x");
    EXPECT_FALSE(TarnConcreteContainerIdentity::containerIdentityWithUUID(&text, user(501), &identifier,
                                                                          2, &error));
    EXPECT_EQ(error, TarnErrorInvalidArgument);

    error = TarnSuccess;
    EXPECT_FALSE(TarnConcreteContainerIdentity::containerIdentityWithUUID(std::nullopt, user(501),
                                                                          "com.x", 2, &error));
    EXPECT_EQ(error, TarnErrorInvalidArgument);

    // Base checks come first and pass their code through.
    error = TarnSuccess;
    EXPECT_FALSE(TarnConcreteContainerIdentity::containerIdentityWithUUID(&text, user(501), nullptr, 2,
                                                                          &error));
    EXPECT_EQ(error, TarnErrorMissingIdentifier);
}

TEST_F(TarnContainerIdentityTest, EqualityIsByUserIdentifierAndAsymmetricForConcrete) {
    auto personal = user(501);
    auto unspecific = user(501, TarnPersonaTypeUnspecific);
    auto a = TarnContainerIdentity::containerIdentityWithUserIdentity(personal, "com.x", 2, nullptr);
    auto b = TarnContainerIdentity::containerIdentityWithUserIdentity(unspecific, "com.x", 2, nullptr);
    ASSERT_TRUE(a && b);
    EXPECT_TRUE(a->isEqual(*b));
    EXPECT_EQ(a->hash(), b->hash());

    auto other = TarnContainerIdentity::containerIdentityWithUserIdentity(user(502), "com.x", 2, nullptr);
    EXPECT_FALSE(a->isEqual(*other));
    auto enterprise = user(501, TarnPersonaTypeEnterprise, "ENT-1");
    auto e = TarnContainerIdentity::containerIdentityWithUserIdentity(enterprise, "com.x", 2, nullptr);
    EXPECT_FALSE(a->isEqual(*e)) << "an enterprise persona is keyed by its unique string";

    Uuid uuid = Uuid::generate();
    auto c1 = TarnConcreteContainerIdentity::containerIdentityWithUUID(uuid, personal, "com.x", 2, nullptr);
    auto c2 = TarnConcreteContainerIdentity::containerIdentityWithUUID(uuid, unspecific, "com.x", 2, nullptr);
    auto c3 = TarnConcreteContainerIdentity::containerIdentityWithUUID(Uuid::generate(), personal,
                                                                       "com.x", 2, nullptr);
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
