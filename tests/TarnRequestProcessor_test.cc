// The entitlement gate and the lock-state callback, without a daemon.
#include <gtest/gtest.h>

#include <atomic>
#include <set>
#include <thread>

#include "Daemon/TarnClientIdentity.h"
#include "Daemon/TarnCommandTable.h"
#include "Daemon/TarnDaemon.h"
#include "Daemon/TarnRequestProcessor.h"
#include "Platform/LockState.h"
#include "Platform/PlatformLog.h"

namespace tarn {
namespace {

TarnClientIdentityRef identityWith(PlistValue entitlements) {
    return TarnClientIdentity::initWithBundleIdentifier("com.ostrea.test", 501, 501, 1, nullptr,
                                                        std::move(entitlements), false, {}, false);
}

PlistValue ents(std::initializer_list<std::pair<const char*, PlistValue>> kv) {
    PlistValue d{PlistDict{}};
    for (auto& [k, v] : kv) d.set(k, v);
    return d;
}

TEST(TarnCommandTableTest, RowsAreIndexedByTheirCommand) {
    for (size_t i = 0; i < kTarnCommandCount; ++i) EXPECT_EQ(gTarnCommandTable[i].command, i);
}

TEST(TarnEntitlementGateTest, ClientWithoutEntitlementsReachesOnlyAnyClientCommands) {
    auto none = identityWith(PlistValue(PlistDict{}));
    std::set<uint64_t> open;
    for (size_t i = 0; i < kTarnCommandCount; ++i) {
        auto g = TarnCheckEntitlements(none, gTarnCommandTable[i]);
        EXPECT_FALSE(g.entitled) << i;
        if (g.admitted) open.insert(i);
    }
    EXPECT_EQ(open, (std::set<uint64_t>{0, 13, 15, 16, 17, 28, 32}));
    // Without an identity the same commands are open, nothing more.
    for (size_t i = 0; i < kTarnCommandCount; ++i)
        EXPECT_EQ(TarnCheckEntitlements(nullptr, gTarnCommandTable[i]).admitted,
                  open.count(i) == 1);
}

TEST(TarnEntitlementGateTest, AllowedIsUnrestrictedExceptForTestabilityCommands) {
    auto allowed = identityWith(ents({{kTarnEntitlementAllowed, true}}));
    for (size_t i = 0; i < kTarnCommandCount; ++i) {
        auto g = TarnCheckEntitlements(allowed, gTarnCommandTable[i]);
        bool testability = std::string(gTarnCommandTable[i].entitlement) == kTarnEntitlementTestability;
        EXPECT_EQ(g.unrestricted, !testability) << i;
        EXPECT_EQ(g.entitled, !testability) << i;
        EXPECT_TRUE(g.allowOtherIdLookup);
        EXPECT_FALSE(g.lookup);
    }
    EXPECT_FALSE(TarnCheckEntitlements(allowed, gTarnCommandTable[25]).admitted);
    EXPECT_FALSE(TarnCheckEntitlements(allowed, gTarnCommandTable[31]).admitted);
    auto both = identityWith(ents({{kTarnEntitlementAllowed, true}, {kTarnEntitlementTestability, true}}));
    auto g = TarnCheckEntitlements(both, gTarnCommandTable[31]);
    EXPECT_TRUE(g.entitled);
    EXPECT_FALSE(g.unrestricted);
}

TEST(TarnEntitlementGateTest, OnlyNumbersCountAsTrueEntitlements) {
    EXPECT_FALSE(identityWith(ents({{kTarnEntitlementAllowed, "YES"}}))
                     ->boolValueOfEntitlement(kTarnEntitlementAllowed));
    EXPECT_TRUE(identityWith(ents({{kTarnEntitlementAllowed, uint64_t{1}}}))
                    ->boolValueOfEntitlement(kTarnEntitlementAllowed));
    // Entitlements that are not a dictionary become an empty one.
    EXPECT_TRUE(identityWith(PlistValue("junk"))->entitlements().isDict());
}

TEST(TarnEntitlementGateTest, WipeListMustBeAnArray) {
    PlatformLogSetQuiet(true);
    auto list = identityWith(ents({{kTarnEntitlementWipeContainer, PlistArray{PlistValue("a")}}}));
    auto g = TarnCheckEntitlements(list, gTarnCommandTable[11]);
    EXPECT_TRUE(g.entitled);
    ASSERT_TRUE(g.wipeList);
    auto flag = identityWith(ents({{kTarnEntitlementWipeContainer, true}}));
    g = TarnCheckEntitlements(flag, gTarnCommandTable[11]);
    EXPECT_FALSE(g.entitled);
    EXPECT_FALSE(g.admitted);
    auto allowed = identityWith(ents({{kTarnEntitlementAllowed, true}, {kTarnEntitlementWipeContainer, true}}));
    g = TarnCheckEntitlements(allowed, gTarnCommandTable[11]);
    EXPECT_TRUE(g.entitled);  // unrestricted callers need no list
    EXPECT_FALSE(g.wipeList);
    PlatformLogSetQuiet(false);
}

TEST(TarnEntitlementGateTest, LookupDictionaryOnlyWhereTheRowAcceptsIt) {
    PlistValue lookup{PlistDict{}};
    lookup.set("appData", PlistArray{PlistValue("x")});
    auto id = identityWith(ents({{kTarnEntitlementLookup, lookup}}));
    EXPECT_TRUE(TarnCheckEntitlements(id, gTarnCommandTable[1]).lookup);
    EXPECT_TRUE(TarnCheckEntitlements(id, gTarnCommandTable[1]).admitted);
    EXPECT_FALSE(TarnCheckEntitlements(id, gTarnCommandTable[5]).lookup);
    auto notDict = identityWith(ents({{kTarnEntitlementLookup, "appData"}}));
    EXPECT_FALSE(TarnCheckEntitlements(notDict, gTarnCommandTable[1]).admitted);
}

// The lock-state queue is suspended once per lock and resumed only after a suspension.
TEST(TarnLockStateTest, SuspendsOnceAndResumesOnlyAfterSuspension) {
    TEST_resetLockState();
    auto ran = std::make_shared<std::atomic<int>>(0);
    auto submit = [&] { TarnLockStateQueue()->async([ran] { ++*ran; }); };
    auto settle = [] { std::this_thread::sleep_for(std::chrono::milliseconds(50)); };

    LockStateTEST_override(0);  // unlocked at start: nothing to resume
    TarnLockStateCallback();
    EXPECT_EQ(TEST_savedLockState(), 0u);
    submit();
    settle();
    EXPECT_EQ(*ran, 1);

    LockStateTEST_override(1);
    TarnLockStateCallback();
    TarnLockStateCallback();  // locked twice: suspended once
    submit();
    settle();
    EXPECT_EQ(*ran, 1);

    LockStateTEST_override(7);  // unknown state: no change
    TarnLockStateCallback();
    EXPECT_EQ(TEST_savedLockState(), 1u);
    settle();
    EXPECT_EQ(*ran, 1);

    LockStateTEST_override(0);
    TarnLockStateCallback();  // one resume balances the one suspend
    settle();
    EXPECT_EQ(*ran, 2);
    LockStateTEST_override(-1);
    TEST_resetLockState();
}

}  // namespace
}  // namespace tarn
