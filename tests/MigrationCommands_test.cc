// Commands 24 and 30 against a running daemon: what a repeated per-user
// migration does again, and a data migration killed part way that runs
// again at the next start and ends where an uninterrupted one does.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <thread>

#include "Daemon/TarnError.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

constexpr const char* kDiskLog = "/private/var/root/Library/Logs/TarnKeeper/tarnkeeperd.log";

size_t countIn(const std::string& text, const std::string& needle) {
    size_t n = 0;
    for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1))
        ++n;
    return n;
}

std::string readFile(const std::string& path) {
    std::ifstream in(path);
    return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

class MigrationCommandsTest : public test::IpcTest {
  protected:
    static std::string create(test::DaemonHarness& daemon, const std::string& client,
                              const std::string& id, int containerClass,
                              std::string* uuid = nullptr) {
        auto reply = daemon.send(
            client, R"({"Command": 0, "Identifier": ")" + id + R"(", "ContainerClass": )" +
                        std::to_string(containerClass) + R"(, "CreateIfNecessary": true})");
        EXPECT_TRUE(reply && errorOf(*reply) == TarnSuccess) << id;
        if (!reply) return "";
        if (uuid) {
            const PlistValue* u = reply->find("ReplyUUID");
            *uuid = u && u->asUuid() ? u->asUuid()->string() : "";
        }
        return stringOf(*reply, "ReplyPath");
    }
};

TEST_F(MigrationCommandsTest, ASecondPerUserMigrationRepeatsAllButTheSubdirectories) {
    if (IsSkipped()) return;
    daemon_->start();
    const std::string plain = create(*daemon_, admin_, "com.app.nobundle", 2);
    const std::string deprecated = create(*daemon_, admin_, "com.ostrea.LegacyShelf", 2);
    create(*daemon_, admin_, "com.app.withbundle", 1);
    std::string uuid;
    create(*daemon_, admin_, "com.app.withbundle", 2, &uuid);
    const std::string classRequest = R"({"Command": %d, "Identifier": "com.app.withbundle", )"
                                     R"("ContainerClass": 2, "UUID": {"$uuid": ")" +
                                     uuid +
                                     R"("}, "Key": "com.ostrea.Pallet.ContentProtectionClass")";
    auto infoRequest = [&](int command, const std::string& more) {
        std::string r = classRequest;
        r.replace(r.find("%d"), 2, std::to_string(command));
        return r + more + "}";
    };
    ASSERT_EQ(TarnSuccess, ask(admin_, infoRequest(5, R"(, "Value": 3)")));
    ASSERT_FALSE(plain.empty());
    ASSERT_TRUE(fs::exists(deprecated));

    fs::remove_all(plain + "/Documents");
    EXPECT_EQ(TarnSuccess, ask(admin_, R"({"Command": 30})"));
    EXPECT_TRUE(fs::is_directory(plain + "/Documents"));
    EXPECT_FALSE(fs::exists(deprecated));

    // The subdirectories are done once; the rest runs every time, and the
    // deprecated container now missing is no failure worth a line.
    fs::remove_all(plain + "/Documents");
    EXPECT_EQ(TarnSuccess, ask(admin_, R"({"Command": 30})"));
    EXPECT_FALSE(fs::exists(plain + "/Documents"));
    const std::string log = readFile(root_.at(kDiskLog));
    EXPECT_EQ(1u, countIn(log, "Performing Per User Subdirectory Migration"));
    EXPECT_EQ(2u, countIn(log, "Performing User Data Protection Migration"));
    EXPECT_EQ(0u, countIn(log, "Could not delete deprecated container"));

    // The application with a bundle container keeps the class it has.
    EXPECT_EQ(0u, countIn(log, "on com.app.withbundle:"));
    auto reply = send(admin_, infoRequest(6, ""));
    ASSERT_EQ(TarnSuccess, errorOf(reply));
    ASSERT_TRUE(reply.find("ReplyInfoValue"));
    EXPECT_EQ(3u, reply.find("ReplyInfoValue")->asUInt64().value_or(0));
}

// A data container whose application has no bundle container is brought to
// the class its entitlements ask for; the change runs after the reply.
TEST_F(MigrationCommandsTest, APerUserMigrationAppliesTheEntitledClassWithoutABundle) {
    if (IsSkipped()) return;
    daemon_->start();
    PlistValue entitlements{PlistDict{}};
    entitlements.set("com.ostrea.private.TarnKeeper.allowed", true);
    entitlements.set("data-protection-class", "com.ostrea.file-protection.complete");
    // The application's first request records its entitlements.
    const std::string app = daemon_->addClient("app", "com.example.entitled", entitlements);
    std::string uuid;
    const std::string path = create(*daemon_, app, "com.example.entitled", 2, &uuid);
    ASSERT_FALSE(path.empty());
    const std::string identity = R"("Identifier": "com.example.entitled", "ContainerClass": 2, )"
                                 R"("UUID": {"$uuid": ")" +
                                 uuid + R"("}, )";
    ASSERT_EQ(TarnSuccess,
              ask(admin_, R"({"Command": 5, )" + identity +
                              R"("Key": "com.ostrea.Pallet.ContentProtectionClass", "Value": 3})"));

    EXPECT_EQ(TarnSuccess, ask(admin_, R"({"Command": 30})"));
    uint64_t recorded = 0;
    for (int i = 0; i < 200 && recorded != 1; ++i) {
        auto reply = send(admin_, R"({"Command": 6, )" + identity +
                                      R"("Key": "com.ostrea.Pallet.ContentProtectionClass"})");
        const PlistValue* value = reply.find("ReplyInfoValue");
        recorded = value ? value->asUInt64().value_or(0) : 0;
        if (recorded != 1) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    EXPECT_EQ(1u, recorded);
}

// Kill the daemon in the middle of command 24 (after the ACL step, in the
// ownership step), start it again and repeat the command: the device ends
// as it does after one uninterrupted command.
TEST_F(MigrationCommandsTest, AKilledDataMigrationEndsLikeAnUninterruptedOne) {
    if (IsSkipped()) return;
    PlistValue entitlements{PlistDict{}};
    entitlements.set("com.ostrea.private.TarnKeeper.allowed", true);
    entitlements.set("com.ostrea.private.TarnKeeper.dataMigration", true);

    auto run = [&](bool interrupted) {
        test::ScratchRoot root(/*activate=*/false);
        test::DaemonHarness daemon(root);
        const std::string migrator =
            daemon.addClient("migrator", "com.ostrea.migrationd", entitlements);
        const std::string admin = daemon.addPrivilegedClient();
        daemon.start();
        const std::string bundle = create(daemon, admin, "com.app.owned", 1);
        std::ofstream(bundle + "/payload") << "x";
        fs::permissions(bundle + "/payload", fs::perms(0600));
        auto system =
            daemon.send(admin, R"({"Command": 15, "Identifier": "com.ostrea.locationd"})");
        const std::string systemPath = system ? test::IpcTest::stringOf(*system, "ReplyPath") : "";
        std::ofstream(systemPath + "/state") << "s";
        if (interrupted) {
            daemon.stop();
            ::setenv("TARN_FAILPOINTS", "fm.standardizeOwnership=kill", 1);
            daemon.start();
            ::unsetenv("TARN_FAILPOINTS");
            EXPECT_FALSE(daemon.send(migrator, R"({"Command": 24})")) << "the daemon died";
            daemon.kill9();
            daemon.start();
        }
        EXPECT_EQ(TarnSuccess, daemon.sendError(migrator, R"({"Command": 24})"));
        // What the migration decides: modes, owners, the recorded steps.
        std::string state;
        for (const std::string& path : {bundle, bundle + "/payload", systemPath + "/state"}) {
            struct stat st {};
            EXPECT_EQ(0, ::lstat(path.c_str(), &st)) << path;
            state += std::to_string(st.st_mode & 07777) + ":" + std::to_string(st.st_uid) + ":" +
                     std::to_string(st.st_gid) + " ";
        }
        const std::string status =
            readFile(root.at("/private/var/root/Library/TarnKeeper/tarn_migration_status.plist"));
        for (const char* type : {"ACLMigration", "BundleMigration", "CodeSigningMigration"})
            state += std::string(type) + (status.find(type) != std::string::npos ? "+ " : "- ");
        daemon.stop();
        return state;
    };
    const std::string uninterrupted = run(false);
    EXPECT_EQ(uninterrupted, run(true));
    EXPECT_NE(std::string::npos, uninterrupted.find("420:33:33")) << uninterrupted;  // 0644
    EXPECT_NE(std::string::npos, uninterrupted.find("BundleMigration+")) << uninterrupted;
}

}  // namespace
}  // namespace tarn
