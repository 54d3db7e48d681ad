// The child test is what stands between a client-supplied relative path and
// root acting on it, so it gets the most cases: links inside and outside the
// base, "..", missing tails, the "/private" rule.
#include <unistd.h>

#include <filesystem>

#include "Daemon/TarnFileManager.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

class TarnFileManagerRealPathTest : public test::ScratchRootTest {
protected:
    void SetUp() override {
        root_.mkdirs("/private/var/x/a");
        root_.mkdirs("/private/var/outside");
        root_.writeFile("/private/var/x/a/file", "data");
        // As on the device: /var leads to /private/var.
        ASSERT_EQ(0, ::symlink("private/var", root_.at("/var").c_str()));
    }
    void link(const std::string& target, const std::string& at) {
        ASSERT_EQ(0, ::symlink(target.c_str(), root_.at(at).c_str())) << at;
    }
    std::optional<FileURL> child(const std::string& suspicious, const std::string& base = "/var/x") {
        return fm_.realPathForURL(root_.at(suspicious), root_.at(base));
    }
    std::string real(const std::string& path) { return std::filesystem::canonical(root_.at(path)).string(); }

    TarnFileManager& fm_ = TarnFileManager::defaultManager();
};

TEST_F(TarnFileManagerRealPathTest, DepthWalk) {
    int32_t end = -7;
    EXPECT_FALSE(fm_._validateSymlink(std::nullopt, 0, &end));
    EXPECT_TRUE(fm_._validateSymlink(std::string("/var/x"), 0, &end));
    EXPECT_EQ(2, end);
    EXPECT_TRUE(fm_._validateSymlink(std::string(""), 5, &end));
    EXPECT_EQ(5, end);
    EXPECT_TRUE(fm_._validateSymlink(std::string("a/../b"), 2, &end));
    EXPECT_EQ(3, end);
    EXPECT_TRUE(fm_._validateSymlink(std::string("a/./../"), 2, &end));  // ends at the start
    EXPECT_EQ(2, end);
    end = -7;
    // A dip below the start fails even when the walk climbs back later.
    EXPECT_FALSE(fm_._validateSymlink(std::string("../a/b"), 2, &end));
    EXPECT_FALSE(fm_._validateSymlink(std::string("a/../../a/b"), 2, &end));
    EXPECT_EQ(-7, end);  // not written on failure
    // Negative starting depths compare signed.
    EXPECT_TRUE(fm_._validateSymlink(std::string("a/.."), -3, nullptr));
    EXPECT_FALSE(fm_._validateSymlink(std::string(".."), -3, nullptr));
}

TEST_F(TarnFileManagerRealPathTest, PlainItemsInsideTheBase) {
    EXPECT_EQ(real("/private/var/x/a/file"), child("/var/x/a/file"));
    EXPECT_EQ(real("/private/var/x/a"), child("/private/var/x/a", "/var/x"));
    EXPECT_EQ(real("/private/var/x/a"), child("/var/x/a", "/private/var/x"));
    // The base is its own child, however it is spelled.
    EXPECT_EQ(real("/private/var/x"), child("/var/x"));
    EXPECT_EQ(real("/private/var/x"), child("/private/var/x", "/private/var/x"));
}

TEST_F(TarnFileManagerRealPathTest, RejectsPrefixAndDotDot) {
    EXPECT_FALSE(fm_.realPathForURL("", root_.at("/var/x")));
    EXPECT_FALSE(fm_.realPathForURL(root_.at("/var/x/a"), ""));
    EXPECT_FALSE(child("/var/outside"));
    EXPECT_FALSE(child("/var", "/var/x"));
    // ".." is refused even when it would land inside the base.
    EXPECT_FALSE(child("/var/x/a/../a/file"));
    EXPECT_FALSE(child("/var/x/../x/a"));
    // A sibling whose name extends the base's is not inside it.
    root_.mkdirs("/private/var/xy");
    EXPECT_FALSE(child("/var/xy"));
    EXPECT_FALSE(child("/var/xy/new"));
}

TEST_F(TarnFileManagerRealPathTest, LinksWithRelativeTargets) {
    root_.mkdirs("/private/var/x/b");
    link("../b", "/private/var/x/a/up");       // base+1 -> base -> base+1
    link("../../outside", "/private/var/x/a/out");
    link("..", "/private/var/x/a/tobase");     // resolves to the base itself
    link("file", "/private/var/x/a/same");
    link("../x", "/private/var/x/inbase");     // lands on the base via its parent
    EXPECT_EQ(real("/private/var/x/b"), child("/var/x/a/up"));
    EXPECT_FALSE(child("/var/x/a/out"));
    EXPECT_EQ(real("/private/var/x"), child("/var/x/a/tobase"));
    EXPECT_EQ(real("/private/var/x/a/file"), child("/var/x/a/same"));
    EXPECT_FALSE(child("/var/x/inbase"));
}

TEST_F(TarnFileManagerRealPathTest, LinksWithAbsoluteTargets) {
    link(root_.at("/private/var/x/a"), "/private/var/x/abs-in");
    link("/etc", "/private/var/x/abs-out");
    EXPECT_FALSE(child("/var/x/abs-in"));  // absolute is refused even when inside
    EXPECT_FALSE(child("/var/x/abs-out"));
}

TEST_F(TarnFileManagerRealPathTest, ChainedLinksThatLeaveTheBase) {
    // "hop" passes the depth walk on its own but leads through a link out.
    link("../../outside", "/private/var/x/a/escape");
    link("a/escape", "/private/var/x/hop");
    EXPECT_FALSE(child("/var/x/hop"));
    // An intermediate link component is resolved by realpath and compared.
    link("/private/var/outside", "/private/var/x/dirlink");
    EXPECT_FALSE(child("/var/x/dirlink/file"));
}

TEST_F(TarnFileManagerRealPathTest, MissingTails) {
    // Inside: the deepest existing prefix resolved, the rest appended as is.
    EXPECT_EQ(real("/private/var/x/a") + "/new/deeper", child("/var/x/a/new/deeper"));
    link("a", "/private/var/x/alias");
    EXPECT_EQ(real("/private/var/x/a") + "/new", child("/var/x/alias/new"));
    // Below a link that leaves the base: refused by the component comparison.
    link(root_.at("/private/var/outside"), "/private/var/x/a/away");
    EXPECT_FALSE(child("/var/x/a/away/new"));
    link("../../outside", "/private/var/x/a/relaway");
    EXPECT_FALSE(child("/var/x/a/relaway/new/more"));
    // A dangling link as the last component is a link, not a missing item.
    link("../../nowhere", "/private/var/x/a/dangling");
    EXPECT_FALSE(child("/var/x/a/dangling"));
    // Nor one whose target does not exist yet: creating the tail would
    // follow it.
    link("missing", "/private/var/x/a/dangling-in");
    EXPECT_FALSE(child("/var/x/a/dangling-in"));
    link("/nonexistent-tarn-dir/sub", "/private/var/x/a/dangling-abs");
    EXPECT_FALSE(child("/var/x/a/dangling-abs/file"));
}

TEST_F(TarnFileManagerRealPathTest, BaseMustExistAndResolve) {
    EXPECT_FALSE(child("/var/nothing/a", "/var/nothing"));
    // The base itself may be reached through a link; its real path is used.
    link("x", "/private/var/xlink");
    EXPECT_EQ(real("/private/var/x/a"), child("/var/xlink/a", "/var/xlink"));
    // A file in the middle of the path is not a missing tail.
    EXPECT_FALSE(child("/var/x/a/file/below"));
}

TEST_F(TarnFileManagerRealPathTest, RealPathWhatExists) {
    EXPECT_FALSE(fm_._realPathWhatExistsInPath("/"));
    EXPECT_EQ(real("/private/var/x") + "/m/n", fm_._realPathWhatExistsInPath(root_.at("/var/x/m/n")));
    EXPECT_EQ(real("/private/var/x/a"), fm_._realPathForURL(root_.at("/var/x/a"), false));
    EXPECT_FALSE(fm_._realPathForURL(root_.at("/var/x/m"), false));
}

TEST_F(TarnFileManagerRealPathTest, HomeDirectories) {
    EXPECT_EQ(real("/private/var/mobile"), TarnFileManager::homeDirectoryURLForPOSIXUID(501));
    // Unknown users fall back to the mobile home under the root.
    EXPECT_EQ(root_.at("/private/var/mobile"), TarnFileManager::homeDirectoryURLForPOSIXUID(4242));
    // A home that does not exist yet is still placed under the root.
    EXPECT_EQ(root_.at("/private/var/installd"), TarnFileManager::homeDirectoryURLForPOSIXUID(33));
}

}  // namespace
}  // namespace tarn
