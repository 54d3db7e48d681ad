#include "Daemon/TarnClientConnection.h"

#include <gtest/gtest.h>

#include <stdexcept>
#include <thread>

#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Daemon/TarnWhitelist.h"
#include "Platform/HostConfiguration.h"
#include "Platform/PlatformLog.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

class TarnClientConnectionTest : public test::ScratchRootTest {
  protected:
    void SetUp() override { TarnUserIdentityCache::TEST_setPersonasAreSupported(false); }
    void TearDown() override { TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt); }

    // A caller signed as `bundleIdentifier` with no lookup right but `lookup`.
    std::shared_ptr<TarnClientConnection> caller(const std::string& bundleIdentifier,
                                                 std::optional<PlistValue> lookup = std::nullopt) {
        auto identity = TarnClientIdentity::initWithBundleIdentifier(
            bundleIdentifier, 501, 501, 1234, TarnUserIdentityCache::defaultUserIdentity(),
            PlistValue(PlistDict{}), false, TarnAuditToken{}, false);
        return TarnClientConnection::initWithClientIdentity(identity, false, false, false,
                                                            std::move(lookup), std::nullopt,
                                                            std::make_shared<TarnCommandQueue>());
    }

    static uint64_t codeOf(const TarnErrorRef& e) { return e ? e->code() : TarnSuccess; }
    // A rule's answer, with its refusal kept in *error for the checks that follow.
    static bool passes(const TarnStatus& answer, TarnErrorRef* error) {
        if (!answer.ok()) *error = answer.error();
        return answer.ok();
    }
};

TEST_F(TarnClientConnectionTest, LookupEntitlementTakesOnlyArraysOfStrings) {
    PlistValue lookup(PlistDict{
        {"appData", PlistValue("com.ostrea.notes")},  // a string, not an array
        {"pluginData", PlistValue(PlistArray{PlistValue("com.a.ext"), PlistValue(uint64_t{7}),
                                             PlistValue("com.b.ext")})},
        {"systemData", PlistValue(PlistArray{PlistValue("com.ostrea.sys")})},
    });
    auto c = caller("com.client", lookup);

    auto appData = c->_lookupForContainerClass(2);
    ASSERT_TRUE(appData);
    EXPECT_TRUE(appData->empty()) << "cached as an empty set";
    EXPECT_EQ(c->_lookupForContainerClass(2).get(), appData.get()) << "filled once per key";
    EXPECT_FALSE(c->isEntitledForLookupWithClass(2, "com.ostrea.notes"));

    EXPECT_EQ(*c->_lookupForContainerClass(4), (std::set<std::string>{"com.a.ext", "com.b.ext"}));
    EXPECT_TRUE(c->isEntitledForLookupWithClass(4, "com.b.ext"));
    EXPECT_FALSE(c->isEntitledForLookupWithClass(4, "7"));

    for (TarnContainerClass c0 : {0ull, 14ull, 99ull})
        EXPECT_FALSE(c->_lookupForContainerClass(c0)) << c0;
    EXPECT_FALSE(caller("com.client")->_lookupForContainerClass(2)) << "no entitlement, no set";

    // Concurrent first use of one key hands every thread the same set.
    auto fresh = caller("com.client", lookup);
    std::vector<TarnLookupSet> seen(8);
    std::vector<std::thread> threads;
    for (size_t i = 0; i < seen.size(); ++i)
        threads.emplace_back([&, i] { seen[i] = fresh->_lookupForContainerClass(12); });
    for (auto& t : threads) t.join();
    for (const auto& s : seen) EXPECT_EQ(s.get(), seen.front().get());
}

TEST_F(TarnClientConnectionTest, LookupRuleGrantsInOrderAndRefusesWith55) {
    auto c =
        caller("com.client",
               PlistValue(PlistDict{{"appGroup", PlistValue(PlistArray{PlistValue("group.a")})}}));
    TarnErrorRef error;
    EXPECT_TRUE(passes(c->_passesLookupRuleForContainerClass(2, "com.client"), &error))
        << "own identifier";
    // A caller without a bundle identifier does not own the container named "".
    EXPECT_FALSE(passes(caller("")->_passesLookupRuleForContainerClass(2, ""), &error));
    EXPECT_TRUE(passes(c->_passesLookupRuleForContainerClass(7, "group.a"), &error))
        << "lookup entitlement";
    EXPECT_FALSE(passes(c->_passesLookupRuleForContainerClass(2, "com.other"), &error));
    EXPECT_EQ(codeOf(error), TarnErrorNotEntitled);
    EXPECT_EQ(error->localizedDescription(),
              "com.client not entitled to retrieve container class 2 with identifier com.other");

    // Group lookup widens groups only, and not for the owner rule.
    EXPECT_FALSE(passes(c->_passesLookupRuleForContainerClass(13, "systemgroup.x"), &error));
    c->setAllowGroupIdLookup(true);
    EXPECT_TRUE(passes(c->_passesLookupRuleForContainerClass(13, "systemgroup.x"), &error));
    EXPECT_TRUE(passes(c->_passesLookupRuleForContainerClass(7, "group.b"), &error));
    EXPECT_FALSE(passes(c->_passesLookupRuleForContainerClass(2, "com.other"), &error));
    EXPECT_FALSE(passes(c->_passesGroupOwnerRuleForContainerClass(7, "com.owner"), &error));
    EXPECT_EQ(
        error->localizedDescription(),
        "com.client not entitled to retrieve group container class 7 with identifier com.owner");
    EXPECT_TRUE(passes(c->_passesGroupOwnerRuleForContainerClass(7, "com.client"), &error));

    c->setAllowOtherIdLookup(true);
    EXPECT_TRUE(passes(c->_passesLookupRuleForContainerClass(2, "com.other"), &error));
    EXPECT_TRUE(passes(c->_passesGroupOwnerRuleForContainerClass(7, "com.owner"), &error));

    auto privileged = TarnClientConnection::privilegedClientConnectionWithUserIdentity(
        TarnUserIdentityCache::defaultUserIdentity());
    EXPECT_TRUE(passes(privileged->_passesLookupRuleForContainerClass(12, "com.any"), &error));
    EXPECT_TRUE(passes(privileged->_passesSystemDataGateForContainerClass(12, "com.any"), &error));
    TarnClientConnection anonymous;
    EXPECT_TRUE(anonymous.unrestricted());
    EXPECT_FALSE(anonymous.allowOtherIdLookup());
    EXPECT_TRUE(passes(anonymous._passesLookupRuleForContainerClass(2, "com.any"), &error));
}

TEST_F(TarnClientConnectionTest, OwnSystemContainerNeedsTheSignatureOrTheList) {
    auto c = caller("com.ostrea.daemonish");
    TarnErrorRef error;
    // The first gate passes on the own identifier; the second does not without a mapping entry.
    EXPECT_TRUE(passes(c->_passesLookupRuleForContainerClass(12, "com.ostrea.daemonish"), &error));
    EXPECT_FALSE(
        passes(c->_passesSystemDataGateForContainerClass(12, "com.ostrea.daemonish"), &error));
    EXPECT_EQ(codeOf(error), TarnErrorNotEntitled);
    EXPECT_EQ(error->localizedDescription(),
              "com.ostrea.daemonish not entitled for system container with identifier "
              "com.ostrea.daemonish");
    EXPECT_TRUE(
        passes(c->_passesSystemDataGateForContainerClass(2, "com.ostrea.daemonish"), &error))
        << "only class 12 has the second gate";

    auto entitled = caller(
        "com.client",
        PlistValue(PlistDict{{"systemData", PlistValue(PlistArray{PlistValue("com.sys")})}}));
    EXPECT_TRUE(passes(entitled->_passesSystemDataGateForContainerClass(12, "com.sys"), &error));
}

TEST_F(TarnClientConnectionTest, CompleteRunsTheCommandQueue) {
    struct Counting : TarnCommand {
        explicit Counting(int* n, bool ok) : n(n), ok(ok) {}
        uint64_t command() const override { return 99; }
        TarnStatus fromQueue(TarnCommandQueue*) override {
            ++*n;
            if (!ok) return TARN_ERROR_CODE(TarnErrorDestroyFailed, nullptr);
            return {};
        }
        int* n;
        bool ok;
    };
    int ran = 0;
    auto c = caller("com.client");
    c->commandQueue()->insertCommand(std::make_shared<Counting>(&ran, true));
    c->commandQueue()->insertCommand(std::make_shared<Counting>(&ran, false));
    c->commandQueue()->insertCommand(std::make_shared<Counting>(&ran, true));
    uint64_t error = TarnSuccess;
    EXPECT_FALSE(c->completeWithError(&error));
    EXPECT_EQ(error, TarnErrorDestroyFailed);
    EXPECT_EQ(ran, 2);

    // A command that throws fails with TarnErrorException and stops the run like any failure.
    struct Throwing : TarnCommand {
        uint64_t command() const override { return 97; }
        TarnStatus fromQueue(TarnCommandQueue*) override { throw std::runtime_error("boom"); }
    };
    PlatformLogSetQuiet(true);
    const HostConfiguration saved = HostConfiguration::shared();
    HostConfiguration customer = saved;
    customer.internalBuild = false;  // an internal build stops at an exception, by design
    HostConfiguration::TEST_setShared(customer);
    TarnGlobalConfiguration::sharedInstance().setIsInternalImage(false);
    auto d = caller("com.client");
    d->commandQueue()->insertCommand(std::make_shared<Throwing>());
    d->commandQueue()->insertCommand(std::make_shared<Counting>(&ran, true));
    error = TarnSuccess;
    EXPECT_FALSE(d->completeWithError(&error));
    EXPECT_EQ(error, TarnErrorException);
    EXPECT_EQ(d->commandQueue()->commands().size(), 1u);
    HostConfiguration::TEST_setShared(saved);
}

}  // namespace
}  // namespace tarn
