// The consistency checker behind `tarnctl verify`: a tree the daemon made is
// clean; each kind of damage is reported with its path, and the command
// exits 1 on a violation.
#include <gtest/gtest.h>
#include <signal.h>

#include <filesystem>
#include <fstream>
#include <thread>

#include "Daemon/TarnConsistencyChecker.h"
#include "Daemon/TarnError.h"
#include "Platform/LockState.h"
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
            const PlistValue* u = r ? r->find("ReplyUUID") : nullptr;
            ASSERT_TRUE(p && p->asString() && u && u->asUuid());
            paths_.push_back(*p->asString());
            uuids_.push_back(u->asUuid()->string());
        }
        daemon_->stop();
    }
    // Whether some violation names `path` (as the report prints it).
    static bool names(const TarnConsistencyReport& r, const std::string& path) {
        for (const auto& v : r.violations)
            if (v.path == StripRootPrefix(path)) return true;
        return false;
    }

    // Whether some note names `path`.
    static bool noted(const TarnConsistencyReport& r, const std::string& path) {
        for (const auto& n : r.notes)
            if (n.path == StripRootPrefix(path)) return true;
        return false;
    }
    // The only file in `dir` below the root, or "" when it holds none or several.
    std::string onlyFileIn(const std::string& dir) {
        std::vector<fs::path> files;
        std::error_code ec;
        for (const auto& e : fs::directory_iterator(root_.at(dir), ec)) files.push_back(e.path());
        return files.size() == 1 ? files[0].string() : std::string();
    }
    // Sends `request` after arming `failpoint`=kill; the daemon must die there.
    void killAt(const std::string& failpoint, const std::string& request,
                const std::string& before = "") {
        startArmed(failpoint + "=kill");
        if (!before.empty()) ASSERT_EQ(daemon_->sendError(admin_, before), TarnSuccess);
        daemon_->signal(SIGUSR2);
        EXPECT_FALSE(daemon_->send(admin_, request)) << "answered instead of dying";
        EXPECT_TRUE(daemon_->waitExit(std::chrono::seconds(10)));
        daemon_->kill9();
    }
    // With `path` holding `damaged`, the checker reports it; then its bytes are back.
    void expectViolationWhenDamaged(const std::string& path, const std::string& damaged) {
        std::ifstream in(path, std::ios::binary);
        const std::string bytes((std::istreambuf_iterator<char>(in)), {});
        in.close();
        std::ofstream(path, std::ios::binary | std::ios::trunc) << damaged;
        const TarnConsistencyReport r = TarnCheckContainerTree();
        EXPECT_TRUE(names(r, path)) << r.describe();
        std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
    }

    std::vector<std::string> paths_;
    std::vector<std::string> uuids_;
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

// The record files a killed replacement and a killed data-protection change
// leave are work start-up finishes, unless damaged; after a restart none is left.
TEST_F(ConsistencyCheckerTest, RecordFilesOfKilledOperationsAreInProgressUnlessDamaged) {
    ASSERT_EQ(LockStateSet(0), 0);
    const char* kReplaceDir = "/private/var/root/Library/TarnKeeper/Replace";
    const char* kPendingDir = "/private/var/root/Library/TarnKeeper/PendingUpdates";

    // Killed after the replace file is down, before anything moved.
    const std::string newer =
        R"({"Command": 0, "ContainerClass": 2, "CreateIfNecessary": true, "Transient": true, )"
        R"("Identifier": "com.check.a"})";
    startArmed("");
    auto made = daemon_->send(admin_, newer);
    const PlistValue* newUuid = made ? made->find("ReplyUUID") : nullptr;
    ASSERT_TRUE(newUuid && newUuid->asUuid());
    daemon_->kill9();
    killAt("replace.park",
           R"({"Command": 2, "OldIdentifier": "com.check.a", "OldContainerClass": 2, )"
           R"("OldContainerUUID": {"$uuid": ")" +
               uuids_[0] +
               R"("}, "NewIdentifier": "com.check.a", "NewContainerClass": 2, )"
               R"("NewContainerUUID": {"$uuid": ")" +
               newUuid->asUuid()->string() + R"("}})");
    const std::string replaceFile = onlyFileIn(kReplaceDir);
    ASSERT_FALSE(replaceFile.empty());
    TarnConsistencyReport r = TarnCheckContainerTree({.orphansAreViolations = true});
    EXPECT_TRUE(r.clean()) << r.describe();
    EXPECT_TRUE(noted(r, replaceFile)) << r.describe();
    expectViolationWhenDamaged(replaceFile, "torn");
    PlistValue relative{PlistDict{}};
    for (const char* key : {"TarnReplaceOperationOldURL", "TarnReplaceOperationNewURL",
                            "TarnReplaceOperationStagingURL", "TarnReplaceOperationDestURL"})
        relative.set(key, std::string("relative/path"));
    expectViolationWhenDamaged(replaceFile, relative.toXml());

    // Killed in the middle of the pass, after the pending file is down (the
    // start before it finishes the replacement).
    killAt("fm.setDataProtectionClass",
           R"({"Command": 21, "Identifier": "com.check.b", "ContainerClass": 2, )"
           R"("DataProtectionClass": 3, "IsThirdParty": false, "RetryIfLocked": false})");
    EXPECT_TRUE(onlyFileIn(kReplaceDir).empty()) << "recovery left the replace file";
    const std::string pendingFile = onlyFileIn(kPendingDir);
    ASSERT_FALSE(pendingFile.empty());
    r = TarnCheckContainerTree({.orphansAreViolations = true});
    EXPECT_TRUE(r.clean()) << r.describe();
    EXPECT_TRUE(noted(r, pendingFile)) << r.describe();
    expectViolationWhenDamaged(pendingFile, "torn");
    {
        std::ifstream in(pendingFile, std::ios::binary);
        const std::string bytes((std::istreambuf_iterator<char>(in)), {});
        auto record = PlistValue::fromBytes(bytes.data(), bytes.size());
        ASSERT_TRUE(record && record->isDict());
        record->set("TarnDataOperationInternalID", std::string("not-a-uuid"));
        expectViolationWhenDamaged(pendingFile, record->toXml());
    }
    // Kept under another container's name, a newer change would not find it.
    const std::string misnamed = pendingFile + ".plist";
    fs::copy_file(pendingFile, misnamed);
    r = TarnCheckContainerTree();
    EXPECT_TRUE(names(r, misnamed)) << r.describe();
    fs::remove(misnamed);

    // A start runs the pending change again and removes its file.
    daemon_->start();
    for (auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
         fs::exists(pendingFile) && std::chrono::steady_clock::now() < deadline;)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    daemon_->stop();
    r = TarnCheckContainerTree({.orphansAreViolations = true});
    EXPECT_TRUE(r.clean()) << r.describe();
    EXPECT_FALSE(noted(r, pendingFile)) << r.describe();
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
