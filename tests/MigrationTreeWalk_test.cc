// The tree passes of the migrations (bundle ownership, system-container
// ACLs) meet directories they cannot open. Such a directory is handed on
// and the walk goes on with its siblings, instead of stopping the pass there.
//
// Root opens any directory, so the test drops the two capabilities that let
// it ignore modes, in a thread of its own (capabilities are per thread).
#include <linux/capability.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <thread>

#include "Daemon/TarnFileManager.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace stdfs = std::filesystem;

// Runs `body` in a thread without CAP_DAC_OVERRIDE and CAP_DAC_READ_SEARCH;
// false when they could not be dropped.
bool runWithoutDacOverride(const std::function<void()>& body) {
    bool dropped = false;
    std::thread worker([&] {
        __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
        __user_cap_data_struct data[2] = {};
        if (::syscall(SYS_capget, &header, data) != 0) return;
        const uint32_t dac = (1u << CAP_DAC_OVERRIDE) | (1u << CAP_DAC_READ_SEARCH);
        data[0].effective &= ~dac;
        if (::syscall(SYS_capset, &header, data) != 0) return;
        dropped = true;
        body();
    });
    worker.join();
    return dropped;
}

class MigrationTreeWalkTest : public test::ScratchRootTest {
  protected:
    std::string p(const std::string& abs) { return root_.at(abs); }
    mode_t modeOf(const std::string& abs) {
        return static_cast<mode_t>(stdfs::symlink_status(p(abs)).permissions()) & 07777;
    }
    // a/file, locked/ (mode 0, holding inner), z/file.
    void makeTree() {
        root_.writeFile("/t/a/file", "a");
        root_.writeFile("/t/locked/inner", "i");
        root_.writeFile("/t/z/file", "z");
        stdfs::permissions(p("/t/a/file"), stdfs::perms(0600));
        stdfs::permissions(p("/t/z/file"), stdfs::perms(0600));
        stdfs::permissions(p("/t/locked/inner"), stdfs::perms(0600));
        stdfs::permissions(p("/t/locked"), stdfs::perms::none);
    }
    void TearDown() override {
        // Let the scratch root's removal in.
        std::error_code ec;
        stdfs::permissions(p("/t/locked"), stdfs::perms(0700), ec);
    }
    TarnFileManager& fm_ = TarnFileManager::defaultManager();
};

TEST_F(MigrationTreeWalkTest, AnUnreadableDirectoryIsHandedOnAndTheWalkGoesOn) {
    TARN_REQUIRE_ROOT();
    makeTree();
    std::vector<std::string> seen;
    int lockedError = 0;
    TarnStatus walked;
    bool dropped = runWithoutDacOverride([&] {
        walked = fm_._traverseDirectory(p("/t"), [&](const TarnTraversalEntry& e) -> TarnStatus {
            if (e.type == FsWalkType::DirectoryPost) return {};
            std::string name = stdfs::relative(e.path, p("/")).string();
            seen.push_back(name);
            if (name == "t/locked") {
                EXPECT_EQ(FsWalkType::Directory, e.type);
                lockedError = e.error;
            }
            return {};
        });
    });
    if (!dropped) GTEST_SKIP() << "cannot drop CAP_DAC_OVERRIDE in this environment";
    ASSERT_TRUE(walked.ok()) << walked.error()->description();
    std::sort(seen.begin(), seen.end());
    // The locked directory itself, never its contents; the sibling after it still.
    EXPECT_EQ((std::vector<std::string>{"t", "t/a", "t/a/file", "t/locked", "t/z", "t/z/file"}),
              seen);
    EXPECT_EQ(EACCES, lockedError);
}

TEST_F(MigrationTreeWalkTest, OwnershipPassFixesTheUnreadableDirectoryAndItsSiblings) {
    TARN_REQUIRE_ROOT();
    makeTree();
    TarnStatus owned;
    bool dropped =
        runWithoutDacOverride([&] { owned = fm_.standardizeOwnershipAtURL(p("/t"), 0, 0); });
    if (!dropped) GTEST_SKIP() << "cannot drop CAP_DAC_OVERRIDE in this environment";
    EXPECT_TRUE(owned.ok()) << owned.error()->description();
    // The directory gets its mode through its parent; what it holds was out of reach.
    EXPECT_EQ(0755u, modeOf("/t/locked"));
    EXPECT_EQ(0644u, modeOf("/t/z/file"));
    EXPECT_EQ(0644u, modeOf("/t/a/file"));
    EXPECT_EQ(0600u, modeOf("/t/locked/inner"));
}

}  // namespace
}  // namespace tarn
