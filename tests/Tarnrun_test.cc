// tarnrun against a running daemon: the confined program writes in its data
// container, its temporary directory and its entitled group, and nowhere
// else, not even in containers of the same user; without Landlock (or
// without a code-signing entry) nothing runs unless asked to run unconfined.
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>
#include <string>
#include <vector>

#include "Daemon/TarnError.h"
#include "Platform/Landlock.h"
#include "Tools/tarnctl/Json.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

constexpr const char* kIdentifier = "com.ostrea.test.confined";

class TarnrunTest : public test::IpcTest {
  protected:
    void SetUp() override {
        IpcTest::SetUp();
        if (IsSkipped()) return;
        if (!std::filesystem::exists(test::BuiltBinary("tarnrun")))
            GTEST_SKIP() << "tarnrun is not built";
        // The program runs as "mobile" and must reach its containers.
        ASSERT_EQ(::chmod(root_.path().c_str(), 0755), 0);
        shell_ = std::filesystem::canonical("/bin/sh").string();
        PlistValue entitlements{PlistDict{}};
        entitlements.set("com.ostrea.security.application-groups",
                         PlistValue(PlistArray{PlistValue("group.mine")}));
        registerProgram(shell_, kIdentifier, entitlements);
        daemon_->start();
    }

    void registerProgram(const std::string& executable, const std::string& identifier,
                         const PlistValue& entitlements) {
        PlistValue entry{PlistDict{}};
        entry.set("Executable", executable);
        entry.set("SigningIdentifier", identifier);
        entry.set("Entitlements", entitlements);
        auto bytes = entry.toBinary();
        root_.writeFile("/etc/tarnkeeper/codesign/confined.plist",
                        std::string(bytes.begin(), bytes.end()));
    }

    // The paths the upcall answers for `args` (data container, or the group's).
    std::string upcallPath(std::vector<std::string> args, uint64_t type) {
        args.insert(args.begin(), "upcall");
        const test::ProcessResult r = daemon_->tarnctl(admin_, args);
        EXPECT_EQ(r.exitCode, 0) << r.err;
        std::string why;
        auto json = tarnctl::JsonToPlist(r.out, &why);
        if (!json || !json->find("Items") || !json->find("Items")->asArray()) return "";
        for (const PlistValue& item : *json->find("Items")->asArray())
            if (item.find("Type")->asUInt64() == type) return stringOf(item, "Value");
        return "";
    }

    test::ProcessResult tarnrun(std::vector<std::string> options, const std::string& script) {
        std::vector<std::string> argv = {test::BuiltBinary("tarnrun"), "--root", root_.path()};
        argv.insert(argv.end(), options.begin(), options.end());
        argv.insert(argv.end(), {"/bin/sh", "-c", script});
        return test::RunProcess(argv);
    }

    std::string shell_;
};

// Landlock off for the tarnrun processes started while it lives.
class NoLandlock {
  public:
    NoLandlock() { ::setenv("TARN_FAILPOINTS", "landlock.abi=errno:38", 1); }
    ~NoLandlock() { ::unsetenv("TARN_FAILPOINTS"); }
};

TEST_F(TarnrunTest, ConfinedProgramWritesOnlyInItsOwnContainers) {
    if (IsSkipped()) return;
    std::string why;
    if (LandlockABIVersion(&why) == 0) GTEST_SKIP() << "Landlock is not available: " << why;

    const std::string mine = upcallPath(
        {"--uid", "501", "--code-signing-id", kIdentifier, "--app-group", "group.mine"}, 1);
    const std::string myGroup = upcallPath(
        {"--uid", "501", "--code-signing-id", kIdentifier, "--app-group", "group.mine"}, 3);
    // Same user, so only the confinement keeps the program out of these.
    const std::string other =
        upcallPath({"--uid", "501", "--code-signing-id", "com.ostrea.test.other"}, 1);
    const std::string theirGroup =
        upcallPath({"--uid", "501", "--code-signing-id", "com.ostrea.test.other", "--app-group",
                    "group.theirs"},
                   3);
    ASSERT_FALSE(mine.empty() || myGroup.empty() || other.empty() || theirGroup.empty());

    // Each line prints what it did, so one run shows every outcome.
    const std::string script =
        "echo \"HOME=$HOME TMPDIR=$TMPDIR PWD=$(pwd)\"; "
        "echo a > \"$HOME/mine\" && echo own; "
        "echo b > \"$TMPDIR/scratch\" && echo tmp; "
        "echo c > '" +
        myGroup +
        "/mine' && echo group; "
        "echo d > '" +
        other +
        "/intruder' && echo other; "
        "echo e > '" +
        theirGroup +
        "/intruder' && echo theirgroup; "
        "cat /etc/passwd > /dev/null && echo reads; exit 0";
    const test::ProcessResult confined = tarnrun({"--user", "mobile"}, script);
    ASSERT_EQ(confined.exitCode, 0) << confined.err;
    EXPECT_NE(confined.out.find("HOME=" + mine + " TMPDIR=" + mine + "/tmp PWD=" + mine),
              std::string::npos)
        << confined.out;
    EXPECT_NE(confined.out.find("own\ntmp\ngroup\nreads\n"), std::string::npos) << confined.out;
    EXPECT_FALSE(std::filesystem::exists(other + "/intruder"));
    EXPECT_FALSE(std::filesystem::exists(theirGroup + "/intruder"));
    struct stat written {};
    ASSERT_EQ(::stat((mine + "/mine").c_str(), &written), 0);
    EXPECT_EQ(written.st_uid, 501u);

    // Unconfined (asked for), the same writes go through: the refusals above
    // were the ruleset's, not the file modes'.
    NoLandlock off;
    const test::ProcessResult open = tarnrun({"--allow-unconfined"}, script);
    ASSERT_EQ(open.exitCode, 0) << open.err;
    EXPECT_NE(open.out.find("other\ntheirgroup\n"), std::string::npos) << open.out;
    EXPECT_NE(open.err.find("running /bin/sh unconfined as asked"), std::string::npos) << open.err;
}

TEST_F(TarnrunTest, RefusesWithoutLandlockOrCodeSigningEntryAndPassesExitStatus) {
    if (IsSkipped()) return;
    {
        NoLandlock off;
        const test::ProcessResult refused = tarnrun({}, "touch \"$HOME/ran\"");
        EXPECT_EQ(refused.exitCode, 77);
        EXPECT_NE(refused.err.find("Landlock is not available (the kernel was built without "
                                   "Landlock); refusing to run /bin/sh unconfined"),
                  std::string::npos)
            << refused.err;
    }
    registerProgram("/nonexistent/program", kIdentifier, PlistValue(PlistDict{}));
    const test::ProcessResult unknown = tarnrun({}, "exit 0");
    EXPECT_EQ(unknown.exitCode, 77);
    EXPECT_NE(unknown.err.find("has no code-signing entry"), std::string::npos) << unknown.err;

    registerProgram(shell_, kIdentifier, PlistValue(PlistDict{}));
    NoLandlock off;  // the status passes through either way; unconfined is quicker to set up
    EXPECT_EQ(tarnrun({"--allow-unconfined"}, "exit 42").exitCode, 42);
    EXPECT_EQ(tarnrun({"--user", "nobody-here"}, "exit 0").exitCode, 67);
}

}  // namespace
}  // namespace tarn
