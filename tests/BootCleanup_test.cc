// The clean-up operations of a connection in this process: what the orphan
// sweep keeps, skips and discards, and the staging sweep when its
// directories cannot even be made.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <iterator>
#include <thread>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/Dispatch.h"
#include "Platform/Failpoints.h"
#include "Platform/PlatformLog.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr const char* kAppData = "/private/var/mobile/Containers/Data/Application";

class BootCleanupTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        PlatformLogSetQuiet(true);
        logPath_ = root_.at("/platform.log");
        PlatformLogSetFile(logPath_);
    }
    void TearDown() override {
        FailpointClearAll();
        PlatformLogSetFile("");
        PlatformLogSetQuiet(false);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
    }

    std::string log() {
        std::ifstream in(logPath_);
        return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    }
    std::string dir(const std::string& name) {
        const std::string path = root_.at(std::string(kAppData) + "/" + name);
        fs::create_directories(path);
        return path;
    }
    // Waits for what was queued on the background queue so far.
    void drainBackgroundQueue() {
        std::promise<void> done;
        TarnClientConnection::_sharedBackgroundQueue()->async([&] { done.set_value(); });
        ASSERT_EQ(done.get_future().wait_for(30s), std::future_status::ready);
    }

    TarnClientConnection connection_;
    std::string logPath_;
};

TEST_F(BootCleanupTest, TheOrphanSweepKeepsContainersAndSkipsWhatVanished) {
    const std::string kept = dir("11111111-2222-4333-8444-555555555555");
    std::ofstream(PathJoin(kept, kTarnMetadataFileName)) << "x";
    const std::string orphan = dir("66666666-7777-4888-8999-AAAAAAAAAAAA");
    const std::string invalid = dir("not-a-container");
    const std::string vanished =
        root_.at(std::string(kAppData) + "/BBBBBBBB-CCCC-4DDD-8EEE-FFFFFFFFFFFF");

    connection_._cleanupOrphanedDataForDirectories(
        std::vector<FileURL>{vanished, kept, orphan, invalid}, TarnContainerClassAppData);
    EXPECT_TRUE(fs::exists(kept));
    EXPECT_FALSE(fs::exists(orphan));
    EXPECT_FALSE(fs::exists(invalid));
    const std::string text = log();
    EXPECT_NE(text.find("Ignoring deleted container path during cleanup: [" + vanished + "]"),
              std::string::npos);
    EXPECT_NE(text.find("Deleting orphaned data missing a metadata file at: " + orphan),
              std::string::npos);
    EXPECT_EQ(text.find("Deleting orphaned data missing a metadata file at: " + invalid),
              std::string::npos);

    // A class directory that is missing is nothing to do; another listing
    // failure is logged.
    auto& fm = TarnFileManager::defaultManager();
    connection_._cleanupOrphanedDataForDirectories(
        fm.urlsForItemsInDirectoryAtURL(root_.at("/nowhere")), TarnContainerClassAppData);
    EXPECT_EQ(log().find("Failed to get items : "), std::string::npos);
    connection_._cleanupOrphanedDataForDirectories(
        fm.urlsForItemsInDirectoryAtURL(kept + "/" + kTarnMetadataFileName),
        TarnContainerClassAppData);
    EXPECT_NE(log().find("Failed to get items : "), std::string::npos);
}

TEST_F(BootCleanupTest, StagingThatCannotBeMadeIsNoErrorAndTheCompletionRunsOnce) {
    root_.mkdirs("/private/var/mobile");  // the user's staging is looked at too
    // No directory can be made: neither staging nor death row exists.
    ASSERT_TRUE(FailpointSet("fm.createDirectory", "errno:13"));
    const uint64_t transactionsBefore = Transaction::openCount();
    std::promise<void> done;
    int calls = 0;
    connection_.keeperCleanupWithCompletion([&] {
        ++calls;
        done.set_value();
    });
    ASSERT_EQ(done.get_future().wait_for(30s), std::future_status::ready);
    drainBackgroundQueue();
    EXPECT_EQ(calls, 1);
    const std::string text = log();
    EXPECT_EQ(text.find("Failed to get items at global staging URL"), std::string::npos) << text;
    EXPECT_EQ(text.find("Failed to get items at per-user staging URL"), std::string::npos) << text;
    // The transaction ends right after the completion, on the same thread.
    for (int i = 0; i < 100 && Transaction::openCount() > transactionsBefore; ++i)
        std::this_thread::sleep_for(10ms);
    EXPECT_EQ(Transaction::openCount(), transactionsBefore);
}

}  // namespace
}  // namespace tarn
