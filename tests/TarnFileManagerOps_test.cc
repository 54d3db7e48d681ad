// Directory creation, moves, copies, removal, listing, traversal, data
// protection and durable writes of the file facade, including the failures
// that callers branch on (EEXIST tolerated, ENOENT as success, EXDEV).
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <functional>
#include <filesystem>
#include <fstream>

#include "Daemon/TarnFileManager.h"
#include "Platform/Failpoints.h"
#include "Platform/LockState.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace stdfs = std::filesystem;

class TarnFileManagerOpsTest : public test::ScratchRootTest {
protected:
    void TearDown() override {
        FailpointClearAll();
        LockStateTEST_override(-1);
    }
    std::string p(const std::string& abs) { return root_.at(abs); }
    FsStat lst(const std::string& abs) {
        FsStat s;
        EXPECT_EQ(0, FsLstat(p(abs), &s)) << abs;
        return s;
    }
    bool exists(const std::string& abs) { return FsLstat(p(abs), nullptr) == 0; }
    std::string read(const std::string& abs) {
        std::ifstream in(p(abs), std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(in), {});
    }
    // Whether the scratch file system keeps our class attribute.
    bool classesSupported() {
        root_.writeFile("/probe", "");
        FsFd fd;
        return FsOpenItem(-1, p("/probe"), &fd) == 0 && FsSetProtectionClass(fd.get(), 0) == 0;
    }
    bool setImmutable(const std::string& abs) {
        return std::system(("chattr +i '" + p(abs) + "' 2>/dev/null").c_str()) == 0;
    }

    TarnFileManager& fm_ = TarnFileManager::defaultManager();
    TarnErrorRef error_;
};

TEST_F(TarnFileManagerOpsTest, CreateDirectoryVariants) {
    EXPECT_TRUE(fm_.createDirectoryAtURL(p("/a/b/c"), true, 0751, &error_));
    EXPECT_EQ(0751u, lst("/a/b/c").mode & 07777);
    EXPECT_EQ(0751u, lst("/a").mode & 07777);
    // Existing directories are fine, with and without intermediates.
    EXPECT_TRUE(fm_.createDirectoryAtURL(p("/a/b/c"), true, 0700, &error_));
    EXPECT_TRUE(fm_.createDirectoryAtURL(p("/a/b/c"), false, 0700, &error_));
    // Without intermediates a missing parent is ENOENT with the mkdir text.
    EXPECT_FALSE(fm_.createDirectoryAtURL(p("/m/n"), false, 0755, &error_));
    ASSERT_TRUE(error_);
    EXPECT_EQ(ENOENT, error_->posixCode());
    EXPECT_NE(std::string::npos, error_->localizedDescription()->find("mkdir of "));
    // A file in the way of make-path.
    root_.writeFile("/f", "x");
    EXPECT_FALSE(fm_.createDirectoryAtURL(p("/f/sub"), true, 0755, &error_));
    EXPECT_EQ(ENOTDIR, error_->posixCode());
    EXPECT_NE(std::string::npos, error_->localizedDescription()->find("mkpath of "));
}

TEST_F(TarnFileManagerOpsTest, CreateExistingDirectoryAppliesClassAndOwner) {
    TARN_REQUIRE_ROOT();
    if (!classesSupported()) GTEST_SKIP() << "scratch file system keeps no extended attributes";
    root_.mkdirs("/d");
    ASSERT_TRUE(fm_.createDirectoryAtURL(p("/d"), false, 0755, 501, kTarnDataProtectionClassC, &error_));
    EXPECT_EQ(501u, lst("/d").uid);
    EXPECT_EQ(501u, lst("/d").gid);
    int32_t cls = -1;
    ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(p("/d"), &cls, &error_));
    EXPECT_EQ(3, cls);
    // Owner 0 leaves the owner alone.
    ASSERT_TRUE(fm_.createDirectoryAtURL(p("/d"), false, 0755, uid_t(0), &error_));
    EXPECT_EQ(501u, lst("/d").uid);
}

TEST_F(TarnFileManagerOpsTest, CreateDirectoryRefusesPlantedLink) {
    TARN_REQUIRE_ROOT();
    // A client replaced the directory with a link to something it wants
    // owned: the owner change must not follow it.
    root_.mkdirs("/victim");
    ASSERT_EQ(0, ::symlink(p("/victim").c_str(), p("/planted").c_str()));
    EXPECT_FALSE(fm_.createDirectoryAtURL(p("/planted"), false, 0755, 501, &error_));
    EXPECT_NE(std::string::npos, error_->localizedDescription()->find("opendir of "));
    EXPECT_EQ(0u, lst("/victim").uid);
}

TEST_F(TarnFileManagerOpsTest, TemporaryDirectories) {
    root_.mkdirs("/tmpd");
    auto a = fm_.createTemporaryDirectoryInDirectoryURL(p("/tmpd"), &error_);
    auto b = fm_.createTemporaryDirectoryInDirectoryURL(p("/tmpd"), "stage.", &error_);
    ASSERT_TRUE(a && b);
    EXPECT_EQ(0u, stdfs::path(*a).filename().string().find("temp."));
    EXPECT_EQ(0u, stdfs::path(*b).filename().string().find("stage."));
    EXPECT_EQ(12u, stdfs::path(*b).filename().string().size());
    FsStat s;
    ASSERT_EQ(0, FsStatFollow(*a, &s));
    EXPECT_EQ(0700u, s.mode & 07777);
    EXPECT_FALSE(fm_.createTemporaryDirectoryInDirectoryURL(p("/missing"), &error_));
    EXPECT_EQ(ENOENT, error_->posixCode());
}

TEST_F(TarnFileManagerOpsTest, MoveAndMissingSources) {
    root_.writeFile("/src/f", "payload");
    EXPECT_TRUE(fm_.moveItemAtURL(p("/src"), p("/dst"), &error_));
    EXPECT_EQ("payload", read("/dst/f"));
    EXPECT_FALSE(exists("/src"));
    // A missing source: the optional variant succeeds and creates nothing.
    EXPECT_TRUE(fm_.moveItemIfExistsAtURL(p("/src"), p("/dst2"), &error_));
    EXPECT_FALSE(exists("/dst2"));
    error_.reset();
    EXPECT_FALSE(fm_.moveItemAtURL(p("/src"), p("/dst2"), &error_));
    ASSERT_TRUE(error_);
    EXPECT_EQ(ENOENT, error_->posixCode());
    EXPECT_TRUE(fm_.copyItemIfExistsAtURL(p("/src"), p("/dst3"), &error_));
    EXPECT_FALSE(fm_.copyItemAtURL(p("/src"), p("/dst3"), &error_));
    EXPECT_EQ(ENOENT, error_->posixCode());
}

TEST_F(TarnFileManagerOpsTest, MoveAcrossVolumesCopiesThenRemoves) {
    // EXDEV injected at the rename: the move falls back to copy + remove.
    root_.writeFile("/src/a/f", "one");
    ASSERT_EQ(0, ::symlink("a/f", p("/src/ln").c_str()));
    ASSERT_TRUE(FailpointSet("fm.move", "errno:18"));
    ASSERT_TRUE(fm_.moveItemAtURL(p("/src"), p("/dst"), &error_));
    EXPECT_EQ("one", read("/dst/a/f"));
    EXPECT_TRUE(lst("/dst/ln").isSymlink());
    EXPECT_FALSE(exists("/src"));
    // A source that cannot be removed afterwards still answers success.
    root_.writeFile("/src2/f", "two");
    ASSERT_TRUE(FailpointSet("fm.remove", "errno:5"));
    EXPECT_TRUE(fm_.moveItemAtURL(p("/src2"), p("/dst2"), &error_));
    EXPECT_EQ("two", read("/dst2/f"));
    EXPECT_TRUE(exists("/src2/f"));
    // Any other rename error is the move's error.
    ASSERT_TRUE(FailpointSet("fm.move", "errno:28"));
    EXPECT_FALSE(fm_.moveItemAtURL(p("/src2"), p("/dst3"), &error_));
    EXPECT_EQ(ENOSPC, error_->posixCode());
}

TEST_F(TarnFileManagerOpsTest, CopyKeepsMetadataAndLinks) {
    root_.writeFile("/src/exe", "#!/bin/sh\n");
    stdfs::permissions(p("/src/exe"), stdfs::perms(0750));
    ASSERT_EQ(0, ::symlink("/etc/passwd", p("/src/abs").c_str()));
    bool xattrs = std::system(("setfattr -n user.tag -v v '" + p("/src/exe") + "' 2>/dev/null").c_str()) == 0;
    auto old = stdfs::last_write_time(p("/src/exe")) - std::chrono::hours(24 * 400);
    stdfs::last_write_time(p("/src/exe"), old);
    ASSERT_TRUE(fm_.copyItemAtURL(p("/src"), p("/dst"), &error_)) << error_->description();
    EXPECT_EQ(0750u, lst("/dst/exe").mode & 07777);
    EXPECT_EQ(old, stdfs::last_write_time(p("/dst/exe")));
    if (xattrs) {
        EXPECT_EQ(0, std::system(("getfattr -n user.tag '" + p("/dst/exe") + "' >/dev/null 2>&1").c_str()));
    }
    EXPECT_EQ(stdfs::path("/etc/passwd"), stdfs::read_symlink(p("/dst/abs")));
    // The destination must not exist: nothing is merged or overwritten.
    EXPECT_FALSE(fm_.copyItemAtURL(p("/src"), p("/dst"), &error_));
    EXPECT_EQ(EEXIST, error_->posixCode());
}

TEST_F(TarnFileManagerOpsTest, RemoveTrees) {
    EXPECT_TRUE(fm_.removeItemAtURL(p("/nothing"), &error_));
    EXPECT_FALSE(fm_.removeItemAtURL("", &error_));
    EXPECT_EQ(EFAULT, error_->posixCode());
    root_.writeFile("/t/a/b/c/f", "x");
    root_.writeFile("/t/.hidden", "x");
    ASSERT_EQ(0, ::symlink("a", p("/t/ln").c_str()));
    EXPECT_TRUE(fm_.removeItemAtURL(p("/t"), &error_));
    EXPECT_FALSE(exists("/t"));
    // A single file and a link at the top.
    root_.writeFile("/single", "x");
    EXPECT_TRUE(fm_.removeItemAtURL(p("/single"), &error_));
    root_.mkdirs("/keep");
    ASSERT_EQ(0, ::symlink(p("/keep").c_str(), p("/toplink").c_str()));
    EXPECT_TRUE(fm_.removeItemAtURL(p("/toplink"), &error_));
    EXPECT_TRUE(exists("/keep"));
}

TEST_F(TarnFileManagerOpsTest, RemoveDoesNotFollowLinksOutOfTheTree) {
    // A link inside the tree to a directory outside: the link goes, the
    // directory it names and its contents stay.
    root_.writeFile("/precious/data", "keep me");
    root_.writeFile("/t/a/f", "x");
    ASSERT_EQ(0, ::symlink(p("/precious").c_str(), p("/t/a/evil").c_str()));
    ASSERT_EQ(0, ::symlink("../../precious", p("/t/a/evil-rel").c_str()));
    EXPECT_TRUE(fm_.removeItemAtURL(p("/t"), &error_));
    EXPECT_FALSE(exists("/t"));
    EXPECT_EQ("keep me", read("/precious/data"));
}

TEST_F(TarnFileManagerOpsTest, RemoveClearsImmutableItems) {
    TARN_REQUIRE_ROOT();
    root_.writeFile("/t/sub/locked", "x");
    root_.writeFile("/t/sub/plain", "x");
    if (!setImmutable("/t/sub/locked")) GTEST_SKIP() << "scratch file system has no immutable flag";
    EXPECT_TRUE(fm_.removeItemAtURL(p("/t"), &error_)) << error_->description();
    EXPECT_FALSE(exists("/t"));
}

TEST_F(TarnFileManagerOpsTest, RemoveReportsTheFirstError) {
    TARN_REQUIRE_ROOT();
    // An immutable directory: its children cannot go (EPERM, no flag on
    // them), the rest of the tree still does.
    root_.writeFile("/t/frozen/child", "x");
    root_.writeFile("/t/other/f", "x");
    if (!setImmutable("/t/frozen")) GTEST_SKIP() << "scratch file system has no immutable flag";
    EXPECT_FALSE(fm_.removeItemAtURL(p("/t"), &error_));
    ASSERT_TRUE(error_);
    EXPECT_EQ(EPERM, error_->posixCode());
    EXPECT_FALSE(exists("/t/other"));
    EXPECT_TRUE(exists("/t/frozen/child"));
}

TEST_F(TarnFileManagerOpsTest, ListingSkipsDotFiles) {
    root_.mkdirs("/d");
    root_.writeFile("/d/.com.ostrea.tarn_keeper.metadata.plist", "x");
    root_.writeFile("/d/.hidden", "x");
    auto items = fm_.urlsForItemsInDirectoryAtURL(p("/d"), &error_);
    ASSERT_TRUE(items);
    EXPECT_TRUE(items->empty());
    root_.writeFile("/d/a", "x");
    root_.mkdirs("/d/b");
    items = fm_.urlsForItemsInDirectoryAtURL(p("/d"), &error_);
    ASSERT_TRUE(items);
    std::sort(items->begin(), items->end());
    EXPECT_EQ((std::vector<FileURL>{p("/d/a"), p("/d/b")}), *items);
    EXPECT_FALSE(fm_.urlsForItemsInDirectoryAtURL(p("/none"), &error_));
    EXPECT_EQ(ENOENT, error_->posixCode());
}

TEST_F(TarnFileManagerOpsTest, TraversalOrderAndStop) {
    root_.writeFile("/t/a/f", "x");
    ASSERT_EQ(0, ::symlink("/", p("/t/a/root").c_str()));
    std::vector<std::string> seen;
    ASSERT_TRUE(fm_._traverseDirectory(p("/t"), &error_, [&](const TarnTraversalEntry& e, TarnErrorRef*) {
        std::string tag = e.type == FsWalkType::DirectoryPost ? "post:" : "";
        seen.push_back(tag + std::to_string(e.level) + ":" + stdfs::path(e.path).filename().string());
        return true;
    }));
    // Pre-order with post visits; the link is an entry, never entered.
    std::vector<std::string> first = {"0:t", "1:a"};
    ASSERT_GE(seen.size(), 6u);
    EXPECT_EQ(first, std::vector<std::string>(seen.begin(), seen.begin() + 2));
    EXPECT_EQ("post:1:a", seen[4]);
    EXPECT_EQ("post:0:t", seen[5]);
    EXPECT_EQ(6u, seen.size());
    // A callback that stops makes the traversal fail with its error.
    EXPECT_FALSE(fm_._traverseDirectory(p("/t"), &error_, [&](const TarnTraversalEntry&, TarnErrorRef* err) {
        *err = TARN_POSIX_ERROR(EIO, "stop");
        return false;
    }));
    EXPECT_EQ(EIO, error_->posixCode());
    EXPECT_FALSE(fm_._traverseDirectory(p("/none"), &error_, [](auto&, auto*) { return true; }));
    EXPECT_EQ(ENOENT, error_->posixCode());
}

TEST_F(TarnFileManagerOpsTest, Existence) {
    ASSERT_EQ(0, ::symlink("nowhere", p("/dangling").c_str()));
    EXPECT_TRUE(fm_.itemExistsAtURL(p("/dangling")));
    EXPECT_FALSE(fm_.itemDoesNotExistAtURL(p("/dangling")));
    EXPECT_FALSE(fm_.itemExistsAtURL(p("/nowhere")));
    EXPECT_TRUE(fm_.itemDoesNotExistAtURL(p("/nowhere")));
    // ENOTDIR is neither an existing item nor a clean "does not exist".
    root_.writeFile("/file", "");
    EXPECT_FALSE(fm_.itemExistsAtURL(p("/file/x")));
    EXPECT_FALSE(fm_.itemDoesNotExistAtURL(p("/file/x")));
}

TEST_F(TarnFileManagerOpsTest, DataProtectionClasses) {
    if (!classesSupported()) GTEST_SKIP() << "scratch file system keeps no extended attributes";
    root_.writeFile("/f", "x");
    int32_t cls = -1;
    ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(p("/f"), &cls, &error_));
    EXPECT_EQ(0, cls);  // no attribute reads as class 0
    ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(p("/f"), 3, nullptr, &error_));
    // A refusing predicate answers YES and changes nothing.
    int32_t offered = -1;
    ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(p("/f"), 4, [&](int32_t current) {
        offered = current;
        return false;
    }, &error_));
    EXPECT_EQ(3, offered);
    ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(p("/f"), &cls, &error_));
    EXPECT_EQ(3, cls);
    // Links are not followed.
    ASSERT_EQ(0, ::symlink("f", p("/ln").c_str()));
    EXPECT_FALSE(fm_.setDataProtectionClassOfItemAtURL(p("/ln"), 2, nullptr, &error_));
    EXPECT_EQ(ELOOP, error_->posixCode());
    EXPECT_FALSE(fm_.dataProtectionClassOfItemAtURL(p("/missing"), &cls, &error_));
    EXPECT_EQ(ENOENT, error_->posixCode());
}

TEST_F(TarnFileManagerOpsTest, ClassOneIsUntouchableWhileLocked) {
    if (!classesSupported()) GTEST_SKIP() << "scratch file system keeps no extended attributes";
    root_.writeFile("/f", "x");
    root_.writeFile("/g", "x");
    ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(p("/f"), 1, nullptr, &error_));
    LockStateTEST_override(1);
    EXPECT_FALSE(fm_.setDataProtectionClassOfItemAtURL(p("/f"), 3, nullptr, &error_));
    EXPECT_EQ(EPERM, error_->posixCode());
    EXPECT_FALSE(fm_.setDataProtectionClassOfItemAtURL(p("/g"), 1, nullptr, &error_));
    EXPECT_EQ(EPERM, error_->posixCode());
    EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(p("/g"), 3, nullptr, &error_));
    // Creating a directory follows the same rules, whether it makes the
    // directory (no class yet) or finds it (its class is read).
    const auto cls = static_cast<TarnDataProtectionClass>(1);
    EXPECT_FALSE(fm_.createDirectoryAtURL(p("/new1"), true, 0755, cls, &error_));
    EXPECT_EQ(EPERM, error_->posixCode());
    ASSERT_TRUE(fm_.createDirectoryAtURL(p("/new3"), true, 0755, static_cast<TarnDataProtectionClass>(3),
                                         &error_));
    int32_t got = 0;
    ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(p("/new3"), &got, &error_));
    EXPECT_EQ(3, got);
    LockStateTEST_override(0);
    ASSERT_TRUE(fm_.createDirectoryAtURL(p("/old1"), false, 0755, cls, &error_));
    LockStateTEST_override(1);
    EXPECT_FALSE(fm_.createDirectoryAtURL(p("/old1"), false, 0755, static_cast<TarnDataProtectionClass>(3),
                                          &error_));
    EXPECT_EQ(EPERM, error_->posixCode());
    LockStateTEST_override(0);
    EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(p("/f"), 3, nullptr, &error_));
}

TEST_F(TarnFileManagerOpsTest, AtomicWritesReplaceWholeOrNothing) {
    root_.mkdirs("/w");
    ASSERT_TRUE(fm_.writeData("first", p("/w/file.plist"), kTarnWriteAtomic | kTarnWriteNoFileProtection,
                              &error_));
    EXPECT_EQ("first", read("/w/file.plist"));
    EXPECT_EQ(0644u, lst("/w/file.plist").mode & 07777);
    // Failing before the rename leaves the old contents and no temporary.
    ASSERT_TRUE(FailpointSet("fm.writeData.beforeRename", "errno:28"));
    EXPECT_FALSE(fm_.writeData("second", p("/w/file.plist"), kTarnWriteAtomic, &error_));
    EXPECT_EQ(ENOSPC, error_->posixCode());
    EXPECT_EQ("first", read("/w/file.plist"));
    EXPECT_EQ(1, std::distance(stdfs::directory_iterator(p("/w")), stdfs::directory_iterator()));
    FailpointClearAll();
    // The write does not follow a link planted at the destination.
    root_.writeFile("/target", "untouched");
    ASSERT_EQ(0, ::symlink(p("/target").c_str(), p("/w/planted").c_str()));
    EXPECT_FALSE(fm_.writeData("evil", p("/w/planted"), 0, &error_));
    EXPECT_TRUE(fm_.writeData("replaced", p("/w/planted"), kTarnWriteAtomic, &error_));
    EXPECT_EQ("untouched", read("/target"));
    EXPECT_EQ("replaced", read("/w/planted"));
    auto back = fm_.readDataAtURL(p("/w/planted"), 100, &error_);
    EXPECT_EQ("replaced", back);
    EXPECT_FALSE(fm_.readDataAtURL(p("/w/planted"), 3, &error_));
    EXPECT_EQ(EFBIG, error_->posixCode());
}

// Run in a child process by the next test (disabled on its own).
TEST(TarnFileManagerCrashChild, DISABLED_WriteUnderFailpoint) {
    const char* path = std::getenv("TARN_CRASH_PATH");
    ASSERT_TRUE(path);
    TarnFileManager::defaultManager().writeData("new", path, kTarnWriteAtomic, nullptr);
}

TEST_F(TarnFileManagerOpsTest, CrashDuringAtomicWriteLeavesOldContents) {
    // The child dies at each failpoint of the write; the file must hold the
    // old or the new contents in full, never anything else.
    root_.mkdirs("/w");
    char self[4096] = {};
    ASSERT_GT(::readlink("/proc/self/exe", self, sizeof self - 1), 0);
    struct {
        const char* failpoint;
        const char* expected;
    } cases[] = {{"fm.writeData.beforeRename", "old"}, {"fm.writeData.afterRename", "new"}};
    for (auto& c : cases) {
        SCOPED_TRACE(c.failpoint);
        ASSERT_TRUE(fm_.writeData("old", p("/w/f"), kTarnWriteAtomic, &error_));
        std::string cmd = "TARN_CRASH_PATH='" + p("/w/f") + "' TARN_FAILPOINTS='" + c.failpoint +
                          "=kill' '" + self +
                          "' --gtest_also_run_disabled_tests "
                          "--gtest_filter=TarnFileManagerCrashChild.DISABLED_WriteUnderFailpoint >/dev/null 2>&1";
        int status = std::system(cmd.c_str());
        // The shell reports a child killed by SIGKILL as exit status 137.
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 128 + 9) << status;
        EXPECT_EQ(c.expected, read("/w/f"));
    }
}

TEST_F(TarnFileManagerOpsTest, FailpointsFailEveryMutation) {
    root_.writeFile("/d/f", "x");
    struct Case {
        const char* name;
        std::function<bool()> op;
    } cases[] = {
        {"fm.createDirectory", [&] { return fm_.createDirectoryAtURL(p("/n"), true, 0755, &error_); }},
        {"fm.createTemporaryDirectory",
         [&] { return fm_.createTemporaryDirectoryInDirectoryURL(p("/d"), &error_).has_value(); }},
        {"fm.move", [&] { return fm_.moveItemAtURL(p("/d/f"), p("/d/g"), &error_); }},
        {"fm.copy", [&] { return fm_.copyItemAtURL(p("/d/f"), p("/d/g"), &error_); }},
        {"fm.remove", [&] { return fm_.removeItemAtURL(p("/d/f"), &error_); }},
        {"fm.writeData", [&] { return fm_.writeData("x", p("/d/w"), kTarnWriteAtomic, &error_); }},
        {"fm.standardizeOwnership", [&] { return fm_.standardizeOwnershipAtURL(p("/d"), 0, 0, &error_); }},
        {"fm.standardizeACLs", [&] { return fm_.standardizeACLsAtURL(p("/d"), false, &error_); }},
        {"fm.setTopLevelACL", [&] { return fm_.setTopLevelSystemContainerACLAtURL(p("/d"), &error_); }},
    };
    for (auto& c : cases) {
        SCOPED_TRACE(c.name);
        ASSERT_TRUE(FailpointSet(c.name, "errno:28"));
        error_.reset();
        EXPECT_FALSE(c.op());
        ASSERT_TRUE(error_);
        if (error_->isPosix()) {
            EXPECT_EQ(ENOSPC, error_->posixCode());
        } else {
            EXPECT_EQ(TarnErrorACLFailed, error_->code());
        }
        FailpointClear(c.name);
    }
    EXPECT_TRUE(exists("/d/f"));
    EXPECT_FALSE(FailpointSet("fm.nonexistent", "errno:1"));
    EXPECT_FALSE(FailpointSet("fm.move", "errno:x"));
    EXPECT_TRUE(FailpointConfigure("fm.move=errno:5@2,fm.copy=sleep:1"));
    EXPECT_FALSE(FailpointConfigure("fm.move=bogus"));
}

}  // namespace
}  // namespace tarn
