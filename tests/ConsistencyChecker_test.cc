// The consistency checker behind `tarnctl verify`: a tree the daemon made is
// clean; each kind of damage is reported with its path, and the command
// exits 1 on a violation.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "Daemon/TarnConsistencyChecker.h"
#include "Daemon/TarnError.h"
#include "Platform/RootPrefix.h"
#include "support/CrashTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

class ConsistencyCheckerTest : public test::CrashTest {
  protected:
    void SetUp() override {
        CrashTest::SetUp();
        if (IsSkipped()) return;
        daemon_->start();
        for (const char* id : {"com.check.a", "com.check.b"}) {
            auto r = daemon_->send(admin_, std::string(R"({"Command": 0, "ContainerClass": 2, )") +
                                               R"("CreateIfNecessary": true, "Identifier": ")" +
                                               id + R"("})");
            const PlistValue* p = r ? r->find("ReplyPath") : nullptr;
            ASSERT_TRUE(p && p->asString());
            paths_.push_back(*p->asString());
        }
        daemon_->stop();
    }
    // Whether some violation names `path` (as the report prints it).
    static bool names(const TarnConsistencyReport& r, const std::string& path) {
        for (const auto& v : r.violations)
            if (v.path == StripRootPrefix(path)) return true;
        return false;
    }

    std::vector<std::string> paths_;
};

TEST_F(ConsistencyCheckerTest, ReportsEveryKindOfDamageWithItsPath) {
    TarnConsistencyReport clean = TarnCheckContainerTree({.orphansAreViolations = true});
    EXPECT_TRUE(clean.clean()) << clean.describe();
    EXPECT_EQ(clean.containersSeen, 2u);

    const fs::path classDir = fs::path(paths_[0]).parent_path();
    // The same identifier live twice.
    const fs::path twin = classDir / "0E0F9C52-1D6B-4B5E-9A0A-000000000001";
    fs::copy(paths_[0], twin, fs::copy_options::recursive);
    // A directory without metadata: an orphan, a violation only when strict.
    const fs::path orphan = classDir / "0E0F9C52-1D6B-4B5E-9A0A-000000000002";
    fs::create_directory(orphan);
    // Metadata that is not a property list.
    std::ofstream(fs::path(paths_[1]) / ".com.ostrea.tarn_keeper.metadata.plist") << "torn";
    // A replace file whose container is nowhere, and one that is garbage.
    const std::string replaceDir = root_.at("/private/var/root/Library/TarnKeeper/Replace");
    const std::string lost = replaceDir + "/6A1C1F7E-9E55-4A0B-8F43-3D2B6C7A1E10.plist";
    PlistValue record{PlistDict{}};
    for (const char* key : {"TarnReplaceOperationOldURL", "TarnReplaceOperationNewURL",
                            "TarnReplaceOperationStagingURL", "TarnReplaceOperationDestURL"})
        record.set(key, root_.at("/nowhere/") + key);
    root_.writeFile(
        "/private/var/root/Library/TarnKeeper/Replace/"
        "6A1C1F7E-9E55-4A0B-8F43-3D2B6C7A1E10.plist",
        record.toXml());
    root_.writeFile("/private/var/root/Library/TarnKeeper/Replace/notes.txt", "x");
    // A pending data-protection file without its keys.
    root_.writeFile("/private/var/root/Library/TarnKeeper/PendingUpdates/com.x-2-501.plist",
                    PlistValue(PlistDict{}).toXml());
    // A damaged code-signing store.
    const std::string db = root_.at("/private/var/root/Library/TarnKeeper/containers.sqlite3");
    if (fs::exists(db)) {
        std::fstream f(db, std::ios::in | std::ios::out | std::ios::binary);
        f.seekp(100);
        f << std::string(4000, '\x5a');
    }

    TarnConsistencyReport lenient = TarnCheckContainerTree();
    EXPECT_TRUE(names(lenient, twin.string()) || names(lenient, paths_[0])) << lenient.describe();
    EXPECT_TRUE(names(lenient, paths_[1])) << lenient.describe();
    EXPECT_FALSE(names(lenient, orphan.string())) << lenient.describe();
    EXPECT_TRUE(names(lenient, lost)) << lenient.describe();
    EXPECT_TRUE(names(lenient, replaceDir + "/notes.txt")) << lenient.describe();
    EXPECT_TRUE(names(
        lenient, root_.at("/private/var/root/Library/TarnKeeper/PendingUpdates/com.x-2-501.plist")))
        << lenient.describe();
    if (fs::exists(db)) EXPECT_TRUE(names(lenient, db)) << lenient.describe();
    EXPECT_TRUE(names(TarnCheckContainerTree({.orphansAreViolations = true}), orphan.string()));

    // The command prints the same findings and fails.
    test::ProcessResult r = daemon_->tarnctl(admin_, {"verify"});
    EXPECT_EQ(r.exitCode, 1) << r.out << r.err;
    EXPECT_NE(r.out.find(StripRootPrefix(paths_[1])), std::string::npos) << r.out;
}

TEST_F(ConsistencyCheckerTest, VerifyRefusesARunningDaemon) {
    daemon_->start();
    test::ProcessResult r = daemon_->tarnctl(admin_, {"verify"});
    EXPECT_EQ(r.exitCode, 3) << r.out << r.err;
    daemon_->stop();
    r = daemon_->tarnctl(admin_, {"verify"});
    EXPECT_EQ(r.exitCode, 0) << r.out << r.err;
}

}  // namespace
}  // namespace tarn
