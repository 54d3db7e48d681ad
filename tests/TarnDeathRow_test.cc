#include <gtest/gtest.h>

#include <filesystem>
#include <future>

#include "Daemon/TarnApplicationTerminationAssertion.h"
#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/Dispatch.h"
#include "Platform/Failpoints.h"
#include "Platform/PropertyList.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

class TarnDeathRowTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        deathRow_ = TarnGlobalConfiguration::sharedInstance().deathrowDirectory();
        fs::create_directories(root_.at("/tmp"));
    }
    void TearDown() override {
        FailpointClearAll();
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
    }

    // Runs one pass and returns its completion code.
    uint64_t pass() {
        std::promise<uint64_t> done;
        connection_.deleteContainersOnDeathRowWithCompletion(
            [&done](uint64_t code) { done.set_value(code); });
        auto f = done.get_future();
        if (f.wait_for(std::chrono::seconds(30)) != std::future_status::ready) {
            ADD_FAILURE() << "pass did not complete";
            return 0;
        }
        return f.get();
    }

    FileURL makeItem(const std::string& name) {
        FileURL dir = root_.at("/private/var/mobile/work/" + name);
        fs::create_directories(PathJoin(dir, "Library"));
        root_.writeFile("/private/var/mobile/work/" + name + "/Library/file", "x");
        return dir;
    }

    size_t deathRowCount() {
        return static_cast<size_t>(
            std::distance(fs::directory_iterator(deathRow_), fs::directory_iterator()));
    }

    TarnClientConnection connection_;
    FileURL deathRow_;
};

TEST_F(TarnDeathRowTest, SameNamesGetTheirOwnSlotsAndAPassDestroysThem) {
    FileURL a = makeItem("one/Data");
    FileURL b = makeItem("two/Data");
    ASSERT_TRUE(connection_._moveItemAtURLToDeathRow(a, true, false).ok());
    ASSERT_TRUE(connection_._moveItemAtURLToDeathRow(b, true, false).ok());
    EXPECT_FALSE(fs::exists(a));
    EXPECT_EQ(deathRowCount(), 2u);
    EXPECT_EQ(pass(), TarnSuccess);
    EXPECT_EQ(deathRowCount(), 0u);
}

TEST_F(TarnDeathRowTest, MovingSomethingAlreadyGoneSucceedsWithoutAPass) {
    uint64_t before = Transaction::openCount();
    EXPECT_TRUE(
        connection_._moveItemAtURLToDeathRow(root_.at("/private/var/mobile/nothing"), true, true)
            .ok());
    EXPECT_EQ(Transaction::openCount(), before) << "no pass was queued";
    EXPECT_EQ(pass(), TarnSuccess);
}

TEST_F(TarnDeathRowTest, UndeletableItemIsMovedToTmp) {
    ASSERT_TRUE(connection_._moveItemAtURLToDeathRow(makeItem("stuck"), true, false).ok());
    // An item that resists removal (as an immutable file on a file system
    // that cannot clear the flag would).
    ASSERT_TRUE(FailpointSet("fm.remove", "errno:1@1"));
    EXPECT_EQ(pass(), TarnSuccess);
    EXPECT_EQ(deathRowCount(), 0u);
    size_t moved = 0;
    for (const auto& e : fs::directory_iterator(root_.at("/tmp")))
        moved += fs::exists(e.path() / "stuck" / "Library" / "file");
    EXPECT_EQ(moved, 1u) << "the item went to the temporary directory whole";
}

TEST_F(TarnDeathRowTest, AnUndeletableItemNeverReplacesWhatTmpHolds) {
    // A container staged for deletion sits on death row under its own name.
    const std::string name = Uuid::generate().string();
    fs::create_directories(PathJoin(deathRow_, name + "/Library"));
    root_.writeFile("/tmp/" + name + "/keep", "mine");
    ASSERT_TRUE(FailpointSet("fm.remove", "errno:1@1"));
    EXPECT_EQ(pass(), TarnSuccess);
    EXPECT_TRUE(fs::exists(root_.at("/tmp/" + name + "/keep")));
    size_t moved = 0;
    for (const auto& e : fs::directory_iterator(root_.at("/tmp")))
        moved += fs::exists(e.path() / name / "Library");
    EXPECT_EQ(moved, 1u) << "it sits in a directory of its own";
}

// Where /tmp is another volume the item stays on death row: a copy there
// would be made again by every pass, as its source cannot be removed either.
TEST_F(TarnDeathRowTest, AnUndeletableItemIsNeverCopiedToTmp) {
    ASSERT_TRUE(connection_._moveItemAtURLToDeathRow(makeItem("stuck"), true, false).ok());
    ASSERT_TRUE(FailpointSet("fm.remove", "errno:1"));
    ASSERT_TRUE(FailpointSet("fm.move", "errno:18"));  // EXDEV
    EXPECT_EQ(pass(), TarnErrorDestroyFailed);
    EXPECT_EQ(pass(), TarnErrorDestroyFailed);
    EXPECT_EQ(deathRowCount(), 1u);
    EXPECT_TRUE(fs::is_empty(root_.at("/tmp")));
    FailpointClearAll();
    EXPECT_EQ(pass(), TarnSuccess);
    EXPECT_EQ(deathRowCount(), 0u);
}

// A /tmp that is missing and cannot be made is a failure, not "already gone".
TEST_F(TarnDeathRowTest, AMissingTmpIsNotTakenForAGoneItem) {
    ASSERT_TRUE(connection_._moveItemAtURLToDeathRow(makeItem("stuck"), true, false).ok());
    fs::remove_all(root_.at("/tmp"));
    ASSERT_TRUE(FailpointSet("fm.remove", "errno:1"));
    ASSERT_TRUE(FailpointSet("fm.createDirectory", "errno:13"));
    EXPECT_EQ(pass(), TarnErrorDestroyFailed);
    EXPECT_EQ(deathRowCount(), 1u);
    FailpointClearAll();
    EXPECT_EQ(pass(), TarnSuccess);
}

TEST_F(TarnDeathRowTest, ItemThatCanBeNeitherRemovedNorMovedStaysAndThePassGoesOn) {
    for (const char* name : {"a", "b", "c"})
        ASSERT_TRUE(connection_._moveItemAtURLToDeathRow(makeItem(name), true, false).ok());
    ASSERT_TRUE(FailpointSet("fm.remove", "errno:1@1"));
    ASSERT_TRUE(FailpointSet("fm.move", "errno:16@1"));
    EXPECT_EQ(pass(), TarnErrorDestroyFailed);
    EXPECT_EQ(deathRowCount(), 1u) << "the stuck item waits for the next pass";
    FailpointClearAll();
    EXPECT_EQ(pass(), TarnSuccess);
    EXPECT_EQ(deathRowCount(), 0u);
}

TEST_F(TarnDeathRowTest, PassesRunOneAfterAnotherUnderATransaction) {
    ASSERT_TRUE(FailpointSet("fm.remove", "sleep:200@1"));
    ASSERT_TRUE(connection_._moveItemAtURLToDeathRow(makeItem("slow"), true, false).ok());
    std::promise<void> first;
    connection_.deleteContainersOnDeathRowWithCompletion([&](uint64_t) { first.set_value(); });
    EXPECT_GE(Transaction::openCount(), 1u);
    EXPECT_EQ(pass(), TarnSuccess) << "queued behind the first pass";
    EXPECT_EQ(first.get_future().wait_for(std::chrono::seconds(0)), std::future_status::ready);
}

// ---- Termination assertions ----

class FakeLifecycle : public TarnApplicationLifecycleService {
  public:
    struct Handle : TarnTerminationAssertionHandle {
        explicit Handle(int* invalidations) : invalidations(invalidations) {}
        void invalidate() override { ++*invalidations; }
        int* invalidations;
    };
    std::unique_ptr<TarnTerminationAssertionHandle> terminationAssertionForBundleIdentifier(
        const std::string&, TarnTerminationReason reason,
        std::function<void(const std::optional<std::string>&)> acquired) override {
        lastReason = reason;
        if (!make) return nullptr;
        // Answer from another thread, as the service does.
        std::thread([acquired, f = failure] { acquired(f); }).detach();
        return std::make_unique<Handle>(&invalidations);
    }
    bool make = true;
    std::optional<std::string> failure;
    int invalidations = 0;
    TarnTerminationReason lastReason = TarnTerminationReasonCritical;
};

TEST(TarnApplicationTerminationAssertionTest, ServicePresentOrNot) {
    TarnApplicationTerminationAssertion::TEST_setLifecycleService(nullptr);
    auto without = TarnApplicationTerminationAssertion::initWithBundleIdentifier(
        "com.ostrea.app", TarnTerminationReasonInstallation);
    ASSERT_TRUE(without) << "no service: go on without an assertion";
    EXPECT_FALSE(without->termAssertion());

    FakeLifecycle service;
    TarnApplicationTerminationAssertion::TEST_setLifecycleService(&service);
    auto held = TarnApplicationTerminationAssertion::initWithBundleIdentifier(
        "com.ostrea.app", TarnTerminationReasonCacheDeletion);
    ASSERT_TRUE(held && held->termAssertion());
    EXPECT_EQ(service.lastReason, TarnTerminationReasonCacheDeletion);
    held->invalidate();
    EXPECT_EQ(service.invalidations, 1);
    EXPECT_FALSE(held->termAssertion());

    service.failure = "app is busy";
    EXPECT_FALSE(TarnApplicationTerminationAssertion::initWithBundleIdentifier(
        "com.ostrea.app", TarnTerminationReasonInstallation));
    EXPECT_EQ(service.invalidations, 2) << "a failed acquisition is invalidated";
    service.make = false;
    EXPECT_FALSE(TarnApplicationTerminationAssertion::initWithBundleIdentifier(
        "com.ostrea.app", TarnTerminationReasonInstallation));
    TarnApplicationTerminationAssertion::TEST_setLifecycleService(nullptr);
}

}  // namespace
}  // namespace tarn
