// Client-named paths below a directory held open: the resolution that stands
// between a relative path from a client and root acting on it, and the
// descriptor-relative acts that follow it. Every resolution case runs both
// with openat2(2) and with the component walk that replaces it on older
// kernels; the two must answer alike.
#include <fcntl.h>
#include <stdio.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <thread>

#include "Daemon/TarnFileManager.h"
#include "Platform/Failpoints.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace stdfs = std::filesystem;

class TarnFileManagerBeneathTest : public test::ScratchRootTest,
                                   public ::testing::WithParamInterface<bool> {
  protected:
    void SetUp() override {
        FsTEST_forceComponentWalk(GetParam());
        root_.writeFile("/base/a/file", "data");
        root_.writeFile("/outside/secret", "s");
        stdfs::create_symlink("a", p("/base/inside-link"));
        stdfs::create_symlink(p("/outside"), p("/base/escape"));
        stdfs::create_symlink("../../outside/secret", p("/base/a/final-link"));
        ASSERT_EQ(0, fm_.openDirectoryAtURL(p("/base"), &base_));
    }
    void TearDown() override {
        FsTEST_forceComponentWalk(false);
        FailpointClearAll();
    }
    std::string p(const std::string& abs) { return root_.at(abs); }
    static int errnoOf(const TarnResult<TarnFileManager::ItemInDirectory>& r) {
        return r.ok() || !r.error() ? 0 : r.error()->posixCode();
    }
    // The inode of an open directory.
    static uint64_t inodeOf(const FsFd& directory) {
        FsStat st;
        EXPECT_EQ(0, FsStatAt(directory.get(), ".", &st));
        return st.ino;
    }
    uint64_t inodeOf(const std::string& abs) {
        FsStat st;
        EXPECT_EQ(0, FsLstat(p(abs), &st)) << abs;
        return st.ino;
    }

    TarnFileManager& fm_ = TarnFileManager::defaultManager();
    FsFd base_;
};

INSTANTIATE_TEST_SUITE_P(Resolution, TarnFileManagerBeneathTest, ::testing::Bool(),
                         [](const auto& info) { return info.param ? "ComponentWalk" : "Openat2"; });

TEST_P(TarnFileManagerBeneathTest, ItemsInsideResolveToTheirDirectoryAndName) {
    for (const char* path : {"a/file", "a//file", "./a/./file", "a/file/"}) {
        SCOPED_TRACE(path);
        auto item = fm_.itemBelowDirectory(base_, path);
        ASSERT_TRUE(item.ok());
        EXPECT_EQ("file", item->name);
        EXPECT_EQ(inodeOf("/base/a"), inodeOf(item->directory));
        ASSERT_TRUE(item->stat);
        EXPECT_TRUE(item->stat->isRegular());
    }
    // A missing last component is an answer, not a failure: a destination.
    auto missing = fm_.itemBelowDirectory(base_, "a/new");
    ASSERT_TRUE(missing.ok());
    EXPECT_FALSE(missing->stat);
    // A link as the last component is reported as a link, never followed.
    auto link = fm_.itemBelowDirectory(base_, "a/final-link");
    ASSERT_TRUE(link.ok());
    ASSERT_TRUE(link->stat);
    EXPECT_TRUE(link->stat->isSymlink());
}

TEST_P(TarnFileManagerBeneathTest, PathsThatLeaveOrPassALinkAreRefused) {
    const struct {
        const char* path;
        int expected;
    } cases[] = {
        {"", EINVAL},
        {".", EINVAL},
        {"./", EINVAL},
        {"/etc/passwd", EXDEV},
        {"..", EXDEV},
        {"../outside/secret", EXDEV},
        {"a/../a/file", EXDEV},  // even when it would come back inside
        {"a/..", EXDEV},
        {"escape/secret", ELOOP},
        {"inside-link/file", ELOOP},  // a link is refused even when it stays inside
        {"missing/file", ENOENT},
        {"a/file/below", ENOTDIR},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.path);
        EXPECT_EQ(c.expected, errnoOf(fm_.itemBelowDirectory(base_, c.path)));
    }
    auto escape = fm_.openDirectoryBelowDirectory(base_, "escape");
    ASSERT_FALSE(escape.ok());
    EXPECT_EQ(ELOOP, escape.error()->posixCode());
    auto again = fm_.openDirectoryBelowDirectory(base_, "");
    ASSERT_TRUE(again.ok());
    EXPECT_EQ(inodeOf("/base"), inodeOf(*again));
}

// The base is the directory that was opened, wherever its path leads later.
TEST_P(TarnFileManagerBeneathTest, ResolutionFollowsTheOpenDirectoryNotItsPath) {
    stdfs::rename(p("/base"), p("/moved"));
    stdfs::create_symlink(p("/outside"), p("/base"));
    auto item = fm_.itemBelowDirectory(base_, "a/file");
    ASSERT_TRUE(item.ok());
    EXPECT_EQ(inodeOf("/moved/a"), inodeOf(item->directory));
    // The rename acts on what was resolved.
    auto dest = fm_.itemBelowDirectory(base_, "renamed");
    ASSERT_TRUE(dest.ok());
    ASSERT_TRUE(
        fm_.renameItemInDirectory(item->directory, item->name, dest->directory, dest->name).ok());
    EXPECT_TRUE(stdfs::exists(p("/moved/renamed")));
    EXPECT_FALSE(stdfs::exists(p("/outside/renamed")));
}

// A directory on the way is swapped for a link to the outside and back,
// again and again, while paths are resolved: every answer is the real
// directory or a refusal, never the outside.
TEST_P(TarnFileManagerBeneathTest, ADirectorySwappedForALinkIsNeverEntered) {
    stdfs::create_symlink(p("/outside"), p("/base/swap"));
    const std::string a = p("/base/a"), swap = p("/base/swap");
    const uint64_t outside = inodeOf("/outside");
    std::atomic<bool> stop{false};
    std::atomic<uint64_t> swaps{0};
    std::thread swapper([&] {
        while (!stop.load()) {
            if (::renameat2(AT_FDCWD, a.c_str(), AT_FDCWD, swap.c_str(), RENAME_EXCHANGE) == 0)
                swaps.fetch_add(1);
        }
    });
    uint64_t entered = 0, refused = 0;
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    for (int i = 0;
         (i < 20000 || swaps.load() < 2000) && std::chrono::steady_clock::now() < deadline; ++i) {
        auto item = fm_.itemBelowDirectory(base_, "a/secret");
        if (!item.ok()) {
            // The walk tells a link by a second look, which may already see
            // the directory swapped back: ENOTDIR is a refusal as well.
            const int err = item.error()->posixCode();
            EXPECT_TRUE(err == ELOOP || err == ENOTDIR) << err;
            ++refused;
            continue;
        }
        ++entered;
        EXPECT_NE(outside, inodeOf(item->directory));
    }
    stop = true;
    swapper.join();
    EXPECT_GT(swaps.load(), 0u);
    EXPECT_GT(entered, 0u);
    EXPECT_GT(refused, 0u);
}

TEST_P(TarnFileManagerBeneathTest, MadeDirectoriesAndTheirModeAndOwner) {
    TARN_REQUIRE_ROOT();
    auto a = fm_.openDirectoryBelowDirectory(base_, "a");
    ASSERT_TRUE(a.ok());
    auto made = fm_.createTemporaryDirectoryInDirectory(*a, "pre.");
    ASSERT_TRUE(made.ok());
    EXPECT_EQ(0u, made->rfind("pre.", 0));
    EXPECT_EQ(10u, made->size());
    FsStat st;
    ASSERT_EQ(0, FsLstat(p("/base/a/" + *made), &st));
    EXPECT_TRUE(st.isDirectory());
    EXPECT_EQ(0700u, st.mode & 07777);
    auto other = fm_.createTemporaryDirectoryInDirectory(*a, "pre.");
    ASSERT_TRUE(other.ok());
    EXPECT_NE(*made, *other);

    ASSERT_TRUE(fm_.setModeOfItemInDirectory(*a, *made, 0755).ok());
    ASSERT_TRUE(fm_.setOwnerOfItemInDirectory(*a, *made, 501, 502).ok());
    ASSERT_EQ(0, FsLstat(p("/base/a/" + *made), &st));
    EXPECT_EQ(0755u, st.mode & 07777);
    EXPECT_EQ(501u, st.uid);
    EXPECT_EQ(502u, st.gid);

    // Through a link neither changes anything.
    ::chmod(p("/outside/secret").c_str(), 0600);
    EXPECT_FALSE(fm_.setModeOfItemInDirectory(*a, "final-link", 0777).ok());
    EXPECT_FALSE(fm_.setOwnerOfItemInDirectory(*a, "final-link", 501, 501).ok());
    ASSERT_EQ(0, FsLstat(p("/outside/secret"), &st));
    EXPECT_EQ(0600u, st.mode & 07777);
    EXPECT_EQ(0u, st.uid);

    for (const char* name : {"fm.setMode", "fm.setOwner", "fm.createTemporaryDirectory"}) {
        SCOPED_TRACE(name);
        ASSERT_TRUE(FailpointSet(name, "errno:28"));
        TarnErrorRef error = std::string(name) == "fm.setMode"
                                 ? fm_.setModeOfItemInDirectory(*a, *made, 0700).error()
                             : std::string(name) == "fm.setOwner"
                                 ? fm_.setOwnerOfItemInDirectory(*a, *made, 0, 0).error()
                                 : fm_.createTemporaryDirectoryInDirectory(*a, "x.").error();
        ASSERT_TRUE(error);
        EXPECT_EQ(ENOSPC, error->posixCode());
        FailpointClear(name);
    }
}

TEST_P(TarnFileManagerBeneathTest, ACLsOfAnItemStayInsideIt) {
    TARN_REQUIRE_ROOT();
    ::chmod(p("/outside/secret").c_str(), 0600);
    root_.writeFile("/base/a/sub/inner", "i");
    stdfs::create_symlink(p("/outside"), p("/base/a/sub/out"));
    auto a = fm_.openDirectoryBelowDirectory(base_, "a");
    ASSERT_TRUE(a.ok());
    ASSERT_TRUE(fm_.standardizeACLsOfItemInDirectory(*a, "sub", p("/base/a/sub"), false).ok());
    FsStat st;
    ASSERT_EQ(0, FsLstat(p("/base/a/sub/inner"), &st));
    EXPECT_EQ(65534u, st.uid) << "items of the tree are standardised";
    ASSERT_EQ(0, FsLstat(p("/base/a/file"), &st));
    EXPECT_EQ(0u, st.uid) << "siblings are not";
    // A link as the item itself: its own owner at most, never its target.
    ASSERT_TRUE(fm_.standardizeACLsOfItemInDirectory(*a, "final-link", p("/x"), false).ok());
    ASSERT_EQ(0, FsLstat(p("/outside/secret"), &st));
    EXPECT_EQ(0600u, st.mode & 07777);
    EXPECT_EQ(0u, st.uid);
    ASSERT_EQ(0, FsLstat(p("/outside"), &st));
    EXPECT_EQ(0u, st.uid);
}

}  // namespace
}  // namespace tarn
