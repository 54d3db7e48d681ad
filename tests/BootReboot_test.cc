// Boot set-up and clean-up of the running daemon across simulated reboots:
// restored system containers, orphan and transient sweeps, staging sweeps,
// the completion notifications, UUID regeneration on a build change, and a
// start-up step that throws.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <thread>

#include "Platform/Failpoints.h"
#include "Platform/Path.h"
#include "support/DaemonHarness.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using test::DaemonHarness;

constexpr const char* kCleanupComplete = "com.ostrea.tarnkeeper.cleanup-complete";
constexpr const char* kRebootCleanupComplete = "com.ostrea.tarnkeeper.reboot-cleanup-complete";
constexpr const char* kBackupBase = "/private/var/mobile/Library/Backup/SystemContainers";
constexpr const char* kAppData = "/private/var/mobile/Containers/Data/Application";
constexpr const char* kCaches = "/private/var/root/Library/Caches/com.ostrea.tarnkeeperd";
constexpr const char* kOrphanUuid = "0A0B0C0D-1111-4222-8333-444455556666";

class BootRebootTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TARN_REQUIRE_DAEMON_BINARIES();
        FailpointClearAll();
        daemon_ = std::make_unique<DaemonHarness>(root_);
        admin_ = daemon_->addPrivilegedClient();
    }
    void TearDown() override { unsetenv("TARN_FAILPOINTS"); }

    void setBuild(bool internal, const std::string& buildVersion = "100A") {
        PlistValue host{PlistDict{}};
        host.set("InternalBuild", internal);
        daemon_->writeHostConfig(host);
        root_.writeFile("/etc/os-release", "BUILD_ID=" + buildVersion + "\n");
    }
    // Stops the daemon and starts it as the first launch after a boot.
    void reboot() {
        if (daemon_->running()) ASSERT_EQ(daemon_->stop(), 0);
        auto r = daemon_->tarnctl(admin_, {"simulate-reboot"});
        ASSERT_EQ(r.exitCode, 0) << r.err;
        daemon_->start();
        ASSERT_TRUE(daemon_->waitForNotification(kRebootCleanupComplete, 10s));
    }
    // The live path of a container, created when missing.
    std::string containerPath(const std::string& identifier, int containerClass) {
        auto reply = daemon_->send(
            admin_, R"({"Command": 0, "Identifier": ")" + identifier + R"(", "ContainerClass": )" +
                        std::to_string(containerClass) + R"(, "CreateIfNecessary": true})");
        const PlistValue* path = reply ? reply->find("ReplyPath") : nullptr;
        EXPECT_TRUE(path && path->asString())
            << daemon_->lastResult().out << daemon_->lastResult().err;
        return path && path->asString() ? *path->asString() : std::string();
    }
    size_t count(const std::string& text, const std::string& needle) {
        size_t n = 0;
        for (size_t pos = text.find(needle); pos != std::string::npos;
             pos = text.find(needle, pos + 1))
            ++n;
        return n;
    }
    size_t logCount(const std::string& needle) { return count(daemon_->platformLog(), needle); }
    size_t notificationCount(const std::string& name) {
        std::ifstream in(root_.at("/run/tarnkeeper/notifications"));
        std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
        return count(text, name + "\n");
    }
    bool deathRowEmpty() {
        const std::string deathRow = root_.at(std::string(kCaches) + "/Dead");
        return !fs::exists(deathRow) || fs::is_empty(deathRow);
    }

    std::unique_ptr<DaemonHarness> daemon_;
    std::string admin_;
};

TEST_F(BootRebootTest, BackupsAreInstalledOnlyAfterABootAndTheBaseGoesOnCustomerBuilds) {
    // Without a backup directory nothing is installed; the base goes unless
    // this is an internal build.
    for (bool internal : {false, true}) {
        SCOPED_TRACE(internal ? "internal build" : "customer build");
        setBuild(internal);
        root_.writeFile(std::string(kBackupBase) + "/leftover", "x");
        daemon_->start();
        EXPECT_EQ(fs::exists(root_.at(kBackupBase)), internal);
        EXPECT_EQ(logCount("Installing system"), 0u);
        ASSERT_EQ(daemon_->stop(), 0);
        ASSERT_EQ(daemon_->tarnctl(admin_, {"simulate-reboot"}).exitCode, 0);
    }

    // A restored container replaces the files of the live one; an item whose
    // destination cannot be removed ends under the failed path.
    setBuild(/*internal=*/true);
    daemon_->start();
    const std::string live = containerPath("com.example.restored", 12);
    ASSERT_FALSE(live.empty());
    std::ofstream(PathJoin(live, "settings")) << "old";
    std::ofstream(PathJoin(live, "stuck")) << "old";
    const std::string backup = std::string(kBackupBase) + "/Data/com.example.restored";
    root_.writeFile(backup + "/settings", "restored");
    root_.writeFile(backup + "/stuck", "restored");
    root_.writeFile(backup + "/Library/Preferences/prefs", "restored");
    root_.writeFile(std::string(kBackupBase) + "/Shared/systemgroup.com.example.restored/data",
                    "group");
    // Items are installed in directory order: fail the removal at the place
    // of "stuck" in that order.
    ASSERT_EQ(daemon_->stop(), 0);
    ASSERT_EQ(daemon_->tarnctl(admin_, {"simulate-reboot"}).exitCode, 0);
    std::vector<std::string> order;
    for (const auto& entry : fs::directory_iterator(root_.at(backup)))
        order.push_back(entry.path().filename());
    const auto stuckAt = std::find(order.begin(), order.end(), "stuck") - order.begin() + 1;
    setenv("TARN_FAILPOINTS",
           ("boot.restore.removeTarget=errno:16@" + std::to_string(stuckAt)).c_str(), 1);
    daemon_->start();
    unsetenv("TARN_FAILPOINTS");
    ASSERT_TRUE(daemon_->waitForNotification(kRebootCleanupComplete, 10s));

    EXPECT_EQ(containerPath("com.example.restored", 12), live)
        << "installed into the live container";
    auto read = [](const std::string& path) {
        std::ifstream in(path);
        return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    };
    EXPECT_EQ(read(PathJoin(live, "settings")), "restored");
    EXPECT_EQ(read(PathJoin(live, "Library/Preferences/prefs")), "restored");
    EXPECT_EQ(read(PathJoin(live, "stuck")), "old");
    const std::string failed =
        root_.at(std::string(kBackupBase) + "/Data.inprogress.failed/com.example.restored/stuck");
    EXPECT_EQ(read(failed), "restored");
    EXPECT_EQ(logCount("Failed to remove destination com.example.restored:stuck"), 1u);
    const std::string group = containerPath("systemgroup.com.example.restored", 13);
    EXPECT_EQ(read(PathJoin(group, "data")), "group");
    EXPECT_FALSE(fs::exists(root_.at(std::string(kBackupBase) + "/Data")));

    // A later start in the same boot installs nothing new.
    root_.writeFile(backup + "/settings", "second");
    ASSERT_EQ(daemon_->stop(), 0);
    daemon_->start();
    EXPECT_EQ(read(PathJoin(live, "settings")), "restored");
    EXPECT_EQ(logCount("Installing system containers"), 1u);
}

TEST_F(BootRebootTest, SweepsRunAfterABootAndStagingAtEveryStart) {
    setBuild(/*internal=*/true);
    daemon_->start();
    const std::string keep = containerPath("com.example.keep", 2);
    ASSERT_FALSE(keep.empty());
    ASSERT_EQ(daemon_->stop(), 0);

    const std::string orphan = std::string(kAppData) + "/" + kOrphanUuid;
    const std::string invalid = std::string(kAppData) + "/not-a-container";
    const std::string transient = std::string(kCaches) + "/Temp/leftover";
    const std::string userTransient = "/private/var/mobile/Containers/Temp/leftover";
    const std::string bundleTransient = "/private/var/containers/Temp/leftover";
    auto plant = [&] {
        for (const std::string& path : {orphan + "/Library/file", invalid + "/file", transient,
                                        userTransient, bundleTransient})
            root_.writeFile(path, "x");
        root_.writeFile(std::string(kCaches) + "/Staging/half-built/file", "x");
        root_.writeFile("/private/var/mobile/Containers/Staging/half-built/file", "x");
    };

    // A second start in the same boot: staging is emptied, nothing else.
    plant();
    daemon_->start();
    EXPECT_FALSE(fs::exists(root_.at(std::string(kCaches) + "/Staging/half-built")));
    EXPECT_FALSE(fs::exists(root_.at("/private/var/mobile/Containers/Staging/half-built")));
    for (const std::string& path : {orphan, invalid, transient, userTransient, bundleTransient})
        EXPECT_TRUE(fs::exists(root_.at(path))) << path;
    EXPECT_EQ(notificationCount(kRebootCleanupComplete), 1u) << "only the first start posts it";
    EXPECT_TRUE(deathRowEmpty());

    // After a boot: orphans and transient data are gone by the time the
    // clean-up is announced; the real container stays where it was.
    plant();
    reboot();
    for (const std::string& path : {orphan, invalid, transient, userTransient, bundleTransient})
        EXPECT_FALSE(fs::exists(root_.at(path))) << path;
    EXPECT_TRUE(deathRowEmpty());
    EXPECT_EQ(containerPath("com.example.keep", 2), keep);
    EXPECT_EQ(logCount("Deleting orphaned data missing a metadata file at: " + root_.at(orphan)),
              1u);
    EXPECT_EQ(logCount("Deleting orphaned data missing a metadata file at: " + root_.at(invalid)),
              0u)
        << "an invalid name is discarded without that line";
    EXPECT_EQ(logCount("***END INTERNAL BUILD REQUEST"), 2u);
    EXPECT_EQ(logCount("Failed to get items"), 0u) << "empty staging directories are no error";
}

TEST_F(BootRebootTest, EachCompletionIsPostedOnceAfterItsWorkEvenWhenEverythingFails) {
    setBuild(/*internal=*/false);
    daemon_->start();
    ASSERT_EQ(daemon_->stop(), 0);
    root_.writeFile(std::string(kAppData) + "/" + kOrphanUuid + "/file", "x");
    root_.writeFile(std::string(kCaches) + "/Staging/half-built/file", "x");
    ASSERT_EQ(daemon_->tarnctl(admin_, {"simulate-reboot"}).exitCode, 0);

    // Nothing can reach death row and nothing there can be removed.
    setenv("TARN_FAILPOINTS", "fm.createTemporaryDirectory=errno:5,fm.remove=errno:5", 1);
    daemon_->start();
    unsetenv("TARN_FAILPOINTS");
    ASSERT_TRUE(daemon_->waitForNotification(kRebootCleanupComplete, 10s));
    ASSERT_EQ(daemon_->stop(), 0) << "every transaction of the clean-ups ended";

    EXPECT_EQ(notificationCount(kRebootCleanupComplete), 1u);
    EXPECT_EQ(notificationCount(kCleanupComplete), 1u);
    EXPECT_TRUE(fs::exists(root_.at(std::string(kAppData) + "/" + kOrphanUuid)));
    EXPECT_TRUE(fs::exists(root_.at(std::string(kCaches) + "/Staging/half-built")));
    const std::string log = daemon_->platformLog();
    const size_t failure = log.rfind("Failed to delete shared transient URL");
    const size_t rebootEnd = log.rfind("signpost end FirstBootCleanup");
    const size_t sweep = log.rfind("Deleting orphaned data missing a metadata file");
    const size_t bootEnd = log.rfind("signpost end BootCleanup");
    ASSERT_NE(failure, std::string::npos);
    ASSERT_NE(sweep, std::string::npos);
    ASSERT_NE(rebootEnd, std::string::npos);
    ASSERT_NE(bootEnd, std::string::npos);
    EXPECT_LT(failure, rebootEnd);
    EXPECT_LT(sweep, rebootEnd) << "the completion follows the orphan sweeps";
    EXPECT_LT(rebootEnd, bootEnd) << "the staging sweep runs after the reboot clean-up";

    // The failed work is done by the next boot.
    reboot();
    EXPECT_FALSE(fs::exists(root_.at(std::string(kAppData) + "/" + kOrphanUuid)));
    EXPECT_FALSE(fs::exists(root_.at(std::string(kCaches) + "/Staging/half-built")));
    EXPECT_TRUE(deathRowEmpty());
}

TEST_F(BootRebootTest, ABuildChangeGivesSystemContainersNewDirectoriesOnce) {
    setBuild(/*internal=*/true, "100A");
    daemon_->start();
    const std::string data = containerPath("com.example.daemon", 12);
    const std::string group = containerPath("systemgroup.com.example.shared", 13);
    const std::string wellKnown = containerPath("com.ostrea.locationd", 12);
    const std::string analytics = containerPath("systemgroup.com.ostrea.osanalytics", 13);
    ASSERT_FALSE(data.empty());
    ASSERT_FALSE(group.empty());
    std::ofstream(PathJoin(data, "kept")) << "x";
    const size_t rolledBefore = logCount("Rolling system container directory UUIDs on disk");

    reboot();  // the same build
    EXPECT_EQ(containerPath("com.example.daemon", 12), data);
    EXPECT_EQ(logCount("Rolling system container directory UUIDs on disk"), rolledBefore);

    setBuild(/*internal=*/true, "101A");
    reboot();
    const std::string newData = containerPath("com.example.daemon", 12);
    const std::string newGroup = containerPath("systemgroup.com.example.shared", 13);
    EXPECT_NE(newData, data);
    EXPECT_NE(newGroup, group);
    EXPECT_FALSE(fs::exists(data));
    EXPECT_TRUE(fs::exists(PathJoin(newData, "kept"))) << "the contents move with the directory";
    EXPECT_EQ(containerPath("com.ostrea.locationd", 12), wellKnown);
    EXPECT_EQ(containerPath("systemgroup.com.ostrea.osanalytics", 13), analytics);
    EXPECT_EQ(logCount("Rolling system container directory UUIDs on disk"), rolledBefore + 1);

    reboot();  // the new build again: nothing moves
    EXPECT_EQ(containerPath("com.example.daemon", 12), newData);
    EXPECT_EQ(logCount("Rolling system container directory UUIDs on disk"), rolledBefore + 1);
}

TEST_F(BootRebootTest, AppGroupsNoEntitlementNamesGoAtBootOnlyInMultiUserMode) {
    for (bool multiUser : {false, true}) {
        SCOPED_TRACE(multiUser ? "multi-user" : "single user");
        PlistValue host{PlistDict{}};
        host.set("InternalBuild", true);
        host.set("MultiUserFlags", uint64_t{multiUser ? 0x80000000u : 0u});
        daemon_->writeHostConfig(host);
        daemon_->start();
        const std::string group = containerPath("group.com.example.unnamed", 7);
        ASSERT_FALSE(group.empty());
        reboot();
        EXPECT_EQ(fs::exists(group), !multiUser);
        ASSERT_EQ(daemon_->stop(), 0);
    }
}

TEST_F(BootRebootTest, AThrowingStartupStepEndsInTheFatalReportOnInternalBuilds) {
    setBuild(/*internal=*/true);
    setenv("TARN_FAILPOINTS", "daemon.startup.step=errno:5@1", 1);
    daemon_->start(/*waitReady=*/false);
    unsetenv("TARN_FAILPOINTS");
    std::string stderrText;
    for (int i = 0; i < 500 && stderrText.find("Stack:") == std::string::npos; ++i) {
        std::this_thread::sleep_for(10ms);
        std::ifstream in(root_.at("/daemon.stderr"));
        stderrText.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
    }
    EXPECT_NE(stderrText.find("** INTERNAL ERROR: Uncaught Exception **"), std::string::npos)
        << stderrText;
    EXPECT_NE(stderrText.find("rebootKeeperSetup"), std::string::npos) << stderrText;
    EXPECT_NE(daemon_->stop(), 0);

    // A customer build logs the exception and finishes starting.
    setBuild(/*internal=*/false);
    setenv("TARN_FAILPOINTS", "daemon.startup.step=errno:5@2", 1);
    daemon_->start();
    unsetenv("TARN_FAILPOINTS");
    EXPECT_GE(logCount("Got exception:"), 1u);
    EXPECT_TRUE(daemon_->waitForNotification(kRebootCleanupComplete, 10s));
}

}  // namespace
}  // namespace tarn
