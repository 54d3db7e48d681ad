// Whole-tree passes: ownership, system-container ACLs and disk usage. These
// run as root on trees that clients write to, so links planted in the tree
// (or swapped in while the pass runs) must never lead the pass outside.
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <filesystem>
#include <thread>

#include "Daemon/TarnFileManager.h"
#include "Platform/HostConfiguration.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace stdfs = std::filesystem;

constexpr gid_t kSystemUsersGID = 1020;  // seeded by the scratch root
constexpr uid_t kNobody = 65534;

class TarnFileManagerOwnershipTest : public test::ScratchRootTest {
protected:
    std::string p(const std::string& abs) { return root_.at(abs); }
    FsStat lst(const std::string& abs) {
        FsStat s;
        EXPECT_EQ(0, FsLstat(p(abs), &s)) << abs;
        return s;
    }
    struct GroupACL {
        int access = -1, def = -1, mask = -1;
    };
    GroupACL acl(const std::string& abs) {
        GroupACL out;
        FsFd parent;
        std::string name;
        EXPECT_EQ(0, FsOpenParent(p(abs), &parent, &name));
        EXPECT_EQ(0, FsGetGroupACLAt(parent.get(), name, kSystemUsersGID, &out.access, &out.def, &out.mask))
            << abs;
        return out;
    }
    // A container-like tree: directories, a plain and an executable file, a
    // link leading out, the metadata file.
    void makeTree(const std::string& top) {
        root_.writeFile(top + "/Library/Prefs/plain", "p");
        root_.writeFile(top + "/tool", "#!/bin/sh\n");
        stdfs::permissions(p(top + "/tool"), stdfs::perms(0700));
        root_.writeFile(top + "/.com.ostrea.tarn_keeper.metadata.plist", "m");
        stdfs::permissions(p(top + "/.com.ostrea.tarn_keeper.metadata.plist"), stdfs::perms(0600));
        root_.writeFile("/outside/secret", "s");
        stdfs::permissions(p("/outside/secret"), stdfs::perms(0600));
        stdfs::create_symlink(p("/outside"), p(top + "/Library/escape"));
        stdfs::create_symlink(p("/outside/secret"), p(top + "/Library/Prefs/file-escape"));
    }
    void expectOutsideUntouched() {
        EXPECT_EQ(0u, lst("/outside").uid);
        EXPECT_EQ(0u, lst("/outside/secret").uid);
        EXPECT_EQ(0600u, lst("/outside/secret").mode & 07777);
        EXPECT_EQ(-1, acl("/outside/secret").access);
        EXPECT_EQ(-1, acl("/outside").def);
    }

    TarnFileManager& fm_ = TarnFileManager::defaultManager();
};

TEST_F(TarnFileManagerOwnershipTest, OwnershipAndModes) {
    TARN_REQUIRE_ROOT();
    makeTree("/c");
    ASSERT_TRUE(fm_.standardizeOwnershipAtURL(p("/c"), 501, 501).ok());
    for (auto* item : {"/c", "/c/Library", "/c/Library/Prefs", "/c/Library/Prefs/plain", "/c/tool",
                       "/c/Library/escape"}) {
        EXPECT_EQ(501u, lst(item).uid) << item;
        EXPECT_EQ(501u, lst(item).gid) << item;
    }
    EXPECT_EQ(0755u, lst("/c/Library").mode & 07777);
    EXPECT_EQ(0755u, lst("/c/tool").mode & 07777);
    EXPECT_EQ(0644u, lst("/c/Library/Prefs/plain").mode & 07777);
    // The metadata file keeps its owner and mode.
    EXPECT_EQ(0u, lst("/c/.com.ostrea.tarn_keeper.metadata.plist").uid);
    EXPECT_EQ(0600u, lst("/c/.com.ostrea.tarn_keeper.metadata.plist").mode & 07777);
    expectOutsideUntouched();
    EXPECT_FALSE(fm_.standardizeOwnershipAtURL(p("/none"), 501, 501).ok());
}

TEST_F(TarnFileManagerOwnershipTest, SystemContainerACLs) {
    TARN_REQUIRE_ROOT();
    makeTree("/sys");
    stdfs::permissions(p("/sys"), stdfs::perms(0755));
    TarnStatus standardized = fm_.standardizeACLsForSystemContainerAtURL(p("/sys"));
    ASSERT_TRUE(standardized.ok())
        << (standardized.error() ? standardized.error()->description() : "");
    // The root keeps mode and owner; the group may add items and inherits rwx.
    // (With an ACL the group bits of the mode show the mask.)
    EXPECT_EQ(0705u, lst("/sys").mode & 07707);
    EXPECT_EQ(0u, lst("/sys").uid);
    GroupACL top = acl("/sys");
    EXPECT_EQ(03, top.access);
    EXPECT_EQ(07, top.def);
    EXPECT_EQ(07, top.mask);  // the owning group (r-x) and the entry (-wx)
    // Below: owner nobody, no access through the mode, full access through the ACL.
    GroupACL dir = acl("/sys/Library/Prefs");
    EXPECT_EQ(07, dir.access);
    EXPECT_EQ(07, dir.def);
    EXPECT_EQ(07, dir.mask);
    GroupACL plain = acl("/sys/Library/Prefs/plain");
    EXPECT_EQ(06, plain.access);
    EXPECT_EQ(06, plain.mask);
    EXPECT_EQ(07, acl("/sys/tool").access);
    for (auto* item : {"/sys/Library/Prefs/plain", "/sys/tool", "/sys/Library"}) {
        FsStat s = lst(item);
        EXPECT_EQ(kNobody, s.uid) << item;
        EXPECT_EQ(kNobody, s.gid) << item;
        // Owner and other bits are 0; the group bits show the ACL mask.
        EXPECT_EQ(0u, s.mode & 0707) << item;
    }
    EXPECT_EQ(kNobody, lst("/sys/Library/escape").uid);  // the link itself
    EXPECT_EQ(-1, acl("/sys/.com.ostrea.tarn_keeper.metadata.plist").access);
    EXPECT_EQ(0u, lst("/sys/.com.ostrea.tarn_keeper.metadata.plist").uid);
    expectOutsideUntouched();
    // Outside a system container the root is just another directory.
    makeTree("/plain");
    ASSERT_TRUE(fm_.standardizeACLsAtURL(p("/plain"), false).ok());
    EXPECT_EQ(07, acl("/plain").access);
    EXPECT_EQ(kNobody, lst("/plain").uid);
}

TEST_F(TarnFileManagerOwnershipTest, TopLevelACLAndMissingGroup) {
    root_.mkdirs("/sc");
    ASSERT_TRUE(fm_.setTopLevelSystemContainerACLAtURL(p("/sc")).ok());
    EXPECT_EQ(03, acl("/sc").access);
    EXPECT_EQ(07, acl("/sc").def);
    // New items below inherit the group's full access.
    root_.writeFile("/sc/new", "n");
    EXPECT_EQ(06, acl("/sc/new").access & 06);
    root_.writeFile("/etc/group", "wheel:x:0:\n");
    EXPECT_EQ(TarnErrorACLFailed,
              fm_.setTopLevelSystemContainerACLAtURL(p("/sc")).code(TarnSuccess));
    EXPECT_EQ(TarnErrorACLFailed, fm_.standardizeACLsAtURL(p("/sc"), true).code(TarnSuccess));
}

TEST_F(TarnFileManagerOwnershipTest, AllSystemContainers) {
    TARN_REQUIRE_ROOT();
    EXPECT_TRUE(
        fm_.standardizeAllSystemContainerACLsAtURL(p("/private/var/containers/System")).ok());
    root_.mkdirs("/private/var/containers/System");
    EXPECT_TRUE(
        fm_.standardizeAllSystemContainerACLsAtURL(p("/private/var/containers/System")).ok());
    root_.writeFile("/private/var/containers/System/A/f", "x");
    root_.writeFile("/private/var/containers/System/B/g", "x");
    ASSERT_TRUE(
        fm_.standardizeAllSystemContainerACLsAtURL(p("/private/var/containers/System")).ok());
    EXPECT_EQ(03, acl("/private/var/containers/System/A").access);
    EXPECT_EQ(06, acl("/private/var/containers/System/B/g").access);
    // A listing error other than "missing" is the pass's error.
    root_.writeFile("/notadir", "");
    TarnStatus notADirectory = fm_.standardizeAllSystemContainerACLsAtURL(p("/notadir"));
    ASSERT_FALSE(notADirectory.ok());
    ASSERT_TRUE(notADirectory.error());
    EXPECT_EQ(ENOTDIR, notADirectory.error()->posixCode());
}

// A directory in the tree is swapped for a link to /outside while the passes
// run, over and over. Whatever the timing, nothing outside may change.
TEST_F(TarnFileManagerOwnershipTest, LinkSwappedInDuringWalkIsNotFollowed) {
    TARN_REQUIRE_ROOT();
    root_.writeFile("/outside/secret", "s");
    stdfs::permissions(p("/outside/secret"), stdfs::perms(0600));
    for (int round = 0; round < 40; ++round) {
        SCOPED_TRACE(round);
        root_.writeFile("/t/d/f1", "x");
        root_.writeFile("/t/d/f2", "x");
        root_.mkdirs("/t/d/sub");
        stdfs::create_symlink(p("/outside"), p("/t/link"));
        std::atomic<bool> stop{false};
        std::thread swapper([&] {
            std::string d = p("/t/d"), aside = p("/t/d.aside"), link = p("/t/link");
            while (!stop.load()) {
                if (std::rename(d.c_str(), aside.c_str()) == 0 && std::rename(link.c_str(), d.c_str()) == 0) {
                    std::rename(d.c_str(), link.c_str());
                    std::rename(aside.c_str(), d.c_str());
                }
            }
        });
        (void)fm_.standardizeOwnershipAtURL(p("/t"), 501, 501);
        (void)fm_.standardizeACLsAtURL(p("/t"), false);
        (void)fm_.removeItemAtURL(p("/t"));
        stop = true;
        swapper.join();
        ASSERT_TRUE(stdfs::exists(p("/outside/secret")));
        expectOutsideUntouched();
        stdfs::remove_all(p("/t"));
    }
}

class TarnFileManagerDiskUsageTest : public TarnFileManagerOwnershipTest {
protected:
    void TearDown() override { HostConfiguration::TEST_setShared(HostConfiguration{}); }
    uint64_t du(const std::string& abs) {
        std::string cmd = "du -s --block-size=1 '" + p(abs) + "'";
        FILE* f = ::popen(cmd.c_str(), "r");
        unsigned long long v = 0;
        if (!f || std::fscanf(f, "%llu", &v) != 1) ADD_FAILURE() << "du failed";
        if (f) ::pclose(f);
        return v;
    }
};

TEST_F(TarnFileManagerDiskUsageTest, MatchesDuAndIgnoresLinks) {
    root_.writeFile("/c/a", std::string(10000, 'a'));
    root_.writeFile("/c/d/b", std::string(70000, 'b'));
    root_.writeFile("/big", std::string(1 << 20, 'x'));
    stdfs::create_hard_link(p("/c/d/b"), p("/c/d/b2"));      // counted once
    stdfs::create_symlink(p("/big"), p("/c/d/big-link"));    // not followed
    uint64_t walked = fm_.diskUsageForURL(p("/c"));
    EXPECT_EQ(du("/c"), walked);
    EXPECT_GE(walked, 80000u);
    EXPECT_LT(walked, 1u << 20);
    EXPECT_EQ(0u, fm_.diskUsageForURL(p("/none")));
    EXPECT_EQ(0u, fm_.diskUsageForURL(""));
    // With fast sizing on, a volume without directory statistics falls back.
    HostConfiguration config;
    config.featureFlags["fast_container_sizing"] = true;
    HostConfiguration::TEST_setShared(config);
    EXPECT_EQ(walked, fm_.fastDiskUsageForURL(p("/c")));
}

}  // namespace
}  // namespace tarn
