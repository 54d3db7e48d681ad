#include "Daemon/TarnTestLocks.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <thread>

#include "Daemon/TarnError.h"
#include "Daemon/TarnLocks.h"
#include "Platform/HostConfiguration.h"
#include "Platform/PlatformLog.h"

namespace tarn {
namespace {

using namespace std::chrono_literals;

constexpr auto kBlocked = 150ms;
constexpr auto kGranted = 10s;

// Runs `work` on its own thread; tells whether it has finished yet.
class Background {
  public:
    explicit Background(std::function<void()> work)
        : future_(std::async(std::launch::async, std::move(work))) {}
    bool finishedWithin(std::chrono::milliseconds bound) {
        return future_.wait_for(bound) == std::future_status::ready;
    }
    bool blocked() { return !finishedWithin(kBlocked); }
    bool finished() {
        return finishedWithin(std::chrono::duration_cast<std::chrono::milliseconds>(kGranted));
    }

  private:
    std::future<void> future_;
};

class TarnTestLocksTest : public ::testing::Test {
  protected:
    static void SetUpTestSuite() { PlatformLogSetQuiet(true); }
    void TearDown() override { EXPECT_EQ(gTarnLocks.TEST_allReaderWriterState(), 0); }

    TarnTestLocks locks_;
};

TEST_F(TarnTestLocksTest, GateHoldsWaitersUntilItsLastRelease) {
    locks_.setEnabled(true);
    locks_.acquireLock(2);
    locks_.acquireLock(2);
    Background waiter([&] { locks_.waitOnLock(2); });
    EXPECT_TRUE(waiter.blocked());
    locks_.waitOnLock(3);  // other gates are open
    locks_.releaseLock(2);
    EXPECT_EQ(locks_.TEST_countForLock(2), 1);
    EXPECT_TRUE(waiter.blocked());
    locks_.releaseLock(2);
    EXPECT_TRUE(waiter.finished());
    // Taken again, the gate closes again.
    locks_.acquireLock(2);
    Background second([&] { locks_.waitOnLock(2); });
    EXPECT_TRUE(second.blocked());
    locks_.releaseLock(2);
    EXPECT_TRUE(second.finished());
}

TEST_F(TarnTestLocksTest, DisabledGatesAreIgnoredAndDisablingReleasesEverything) {
    locks_.acquireLock(4);
    locks_.waitOnLock(4);  // disabled: returns at once
    locks_.releaseLock(4);

    locks_.setEnabled(true);
    locks_.acquireLock(1);
    locks_.acquireLock(5);
    EXPECT_EQ(gTarnLocks.TEST_allReaderWriterState(), -1);
    Background gated([&] { locks_.waitOnLock(5); });
    EXPECT_TRUE(gated.blocked());
    locks_.setEnabled(false);
    EXPECT_FALSE(locks_.enabled());
    EXPECT_TRUE(gated.finished());
    EXPECT_EQ(gTarnLocks.TEST_allReaderWriterState(), 0);
    for (uint64_t lock = 0; lock < TarnTestLocks::kLockCount; ++lock)
        EXPECT_EQ(locks_.TEST_countForLock(lock), 0) << lock;
}

TEST_F(TarnTestLocksTest, LockZeroAdmitsIdentifierReadersAndHoldsWriters) {
    locks_.acquireLock(0);
    Background reader([] {
        gTarnLocks.read_lock_identifier(std::string("T0-READ"));
        gTarnLocks.unlock_identifier(std::string("T0-READ"));
    });
    EXPECT_TRUE(reader.finished());
    Background writer([] {
        gTarnLocks.write_lock_identifier(std::string("T0-WRITE"));
        gTarnLocks.unlock_identifier(std::string("T0-WRITE"));
    });
    EXPECT_TRUE(writer.blocked());
    locks_.releaseLock(0);
    EXPECT_TRUE(writer.finished());
}

TEST_F(TarnTestLocksTest, UnbalancedReleaseAborts) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "death tests fork a threaded process";
#endif
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(locks_.releaseLock(3), "Unbalanced update to test lock: 3 by: -1 from: 0");
}

// ---- Command 31 ----

class TarnTestLockCommandTest : public ::testing::Test {
  protected:
    static void SetUpTestSuite() { PlatformLogSetQuiet(true); }
    void SetUp() override { setInternal(true); }
    void TearDown() override {
        setInternal(true);
        EXPECT_EQ(send(7, false), TarnSuccess);  // leaves nothing held for the next test
        HostConfiguration::TEST_setShared(saved_);
        EXPECT_EQ(gTarnLocks.TEST_allReaderWriterState(), 0);
    }

    void setInternal(bool internal) {
        HostConfiguration config = saved_;
        config.internalBuild = internal;
        HostConfiguration::TEST_setShared(config);
    }
    static uint64_t send(uint64_t lock, bool enable) {
        PlistValue request(
            PlistDict{{"Command", uint64_t{31}}, {"TestLock", lock}, {"Enable", enable}});
        PlistValue reply;
        uint64_t error = TarnSuccess;
        TarnHandleTestLockCommand({}, request, reply, nullptr, &error);
        return error;
    }

    const HostConfiguration saved_ = HostConfiguration::shared();
    TarnTestLocks& shared_ = TarnTestLocks::sharedInstance();
};

TEST_F(TarnTestLockCommandTest, LockSevenSwitchesOffOrIsRefused) {
    EXPECT_EQ(send(3, true), TarnSuccess);
    EXPECT_TRUE(shared_.enabled());
    EXPECT_EQ(send(7, true), TarnErrorBadInput);
    EXPECT_EQ(send(8, false), TarnErrorBadInput);
    EXPECT_TRUE(shared_.enabled());
    EXPECT_EQ(send(7, false), TarnSuccess);
    EXPECT_FALSE(shared_.enabled());
    EXPECT_EQ(shared_.TEST_countForLock(3), 0);
    // The held set was cleared with it: taking 3 again takes it.
    EXPECT_EQ(send(3, true), TarnSuccess);
    EXPECT_EQ(shared_.TEST_countForLock(3), 1);
}

TEST_F(TarnTestLockCommandTest, CustomerBuildSucceedsWithoutEffect) {
    setInternal(false);
    EXPECT_EQ(send(1, true), TarnSuccess);
    EXPECT_EQ(send(9, true), TarnSuccess);
    EXPECT_EQ(gTarnLocks.TEST_allReaderWriterState(), 0);
    EXPECT_FALSE(shared_.enabled());
    EXPECT_EQ(shared_.TEST_countForLock(1), 0);
}

TEST_F(TarnTestLockCommandTest, LockOneHoldsGlobalUsersAcrossRequests) {
    EXPECT_EQ(send(1, true), TarnSuccess);
    EXPECT_EQ(send(1, true), TarnSuccess);  // already held: no second count
    EXPECT_EQ(shared_.TEST_countForLock(1), 1);
    Background user([] {
        gTarnLocks.read_lock_all_identifiers();
        gTarnLocks.unlock_all_identifiers();
    });
    EXPECT_TRUE(user.blocked());
    EXPECT_EQ(send(2, true), TarnSuccess);
    // 0 was never taken: releasing it leaves the global write lock alone.
    EXPECT_EQ(send(0, false), TarnSuccess);
    EXPECT_TRUE(user.blocked());
    EXPECT_EQ(send(1, false), TarnSuccess);
    EXPECT_TRUE(user.finished());
    EXPECT_TRUE(shared_.enabled());  // gate 2 is still held
    EXPECT_EQ(send(2, false), TarnSuccess);
    EXPECT_FALSE(shared_.enabled());  // the last held lock went
}

}  // namespace
}  // namespace tarn
