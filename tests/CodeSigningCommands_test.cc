// Code-signing information and group containers over IPC: what an installer
// and a client see when information is recorded (command 18), read (19),
// invalidated (20), registered by the gate, and when groups are dropped.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "Daemon/TarnError.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Platform/Failpoints.h"
#include "Tools/tarnctl/Json.h"
#include "support/DaemonHarness.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using test::DaemonHarness;

class CodeSigningCommandsTest : public test::IpcTest {
  protected:
    // Sends as the installer (admin) and answers the reply's code.
    uint64_t ask(const std::string& json) { return errorOf(send(admin_, json)); }

    // Command 18 for `identifier` with these entitlements (JSON object text)
    // and options (JSON members, without braces).
    uint64_t record(const std::string& identifier, const std::string& entitlements,
                    const std::string& options = "") {
        return ask(R"({"Command": 18, "Identifier": ")" + identifier +
                   R"(", "CodeSigningInfo": {"com.ostrea.TarnKeeper.Entitlements": )" +
                   entitlements + R"(}, "OptionsDictionary": {)" + options + "}}");
    }
    static std::string groups(const std::string& list) {
        return R"({"com.ostrea.security.application-groups": )" + list + "}";
    }
    // Command 19: TarnSuccess when the identifier has information a client may see.
    uint64_t readInfo(const std::string& identifier) {
        return ask(R"({"Command": 19, "Identifier": ")" + identifier + R"("})");
    }
    uint64_t create(const std::string& identifier, int containerClass) {
        return ask(R"({"Command": 0, "CreateIfNecessary": true, "ContainerClass": )" +
                   std::to_string(containerClass) + R"(, "Identifier": ")" + identifier + R"("})");
    }
    uint64_t lookUp(const std::string& identifier, int containerClass) {
        return ask(R"({"Command": 0, "ContainerClass": )" + std::to_string(containerClass) +
                   R"(, "Identifier": ")" + identifier + R"("})");
    }
    std::string diskLog() const {
        std::ifstream in(root_.at("/private/var/root/Library/Logs/TarnKeeper/tarnkeeperd.log"));
        return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    }
    static size_t countIn(const std::string& log, const std::string& needle) {
        size_t n = 0;
        for (size_t at = log.find(needle); at != std::string::npos; at = log.find(needle, at + 1))
            ++n;
        return n;
    }
    size_t countInLog(const std::string& needle) { return countIn(daemon_->platformLog(), needle); }
    size_t storeWritesFor(const std::string& identifier) {
        return countInLog("Set Code Signing Mapping for ID: " + identifier + " ");
    }
};

TEST_F(CodeSigningCommandsTest, AGroupGoesWithItsLastReferenceAndNotBefore) {
    daemon_->start();
    // A alone names group.solo; A and B both name group.shared.
    ASSERT_EQ(record("com.a", groups(R"(["group.solo", "group.shared"])")), TarnSuccess);
    ASSERT_EQ(record("com.b", groups(R"(["group.shared"])")), TarnSuccess);
    ASSERT_EQ(create("group.solo", 7), TarnSuccess);
    ASSERT_EQ(create("group.shared", 7), TarnSuccess);

    // Reordering drops nothing.
    ASSERT_EQ(record("com.a", groups(R"(["group.shared", "group.solo"])")), TarnSuccess);
    EXPECT_EQ(lookUp("group.solo", 7), TarnSuccess);
    EXPECT_EQ(lookUp("group.shared", 7), TarnSuccess);

    // A drops both: the group only A named is gone by the time the reply
    // arrives; the one B still names stays.
    ASSERT_EQ(record("com.a", groups("[]")), TarnSuccess);
    EXPECT_EQ(lookUp("group.solo", 7), TarnErrorNotFound);
    EXPECT_EQ(lookUp("group.shared", 7), TarnSuccess);
    EXPECT_GE(countInLog("ID: group.shared is 2"), 1u) << daemon_->platformLog();

    // A system group dropped from entitlements is never deleted.
    const std::string systemGroup =
        R"({"com.ostrea.security.system-groups": ["systemgroup.com.example.sg"]})";
    ASSERT_EQ(record("com.c", systemGroup), TarnSuccess);
    ASSERT_EQ(create("systemgroup.com.example.sg", 13), TarnSuccess);
    ASSERT_EQ(record("com.c", "{}"), TarnSuccess);
    EXPECT_EQ(lookUp("systemgroup.com.example.sg", 13), TarnSuccess);
}

TEST_F(CodeSigningCommandsTest, RecordingTwiceWritesOnceAndChildrenFollowTheirParent) {
    daemon_->start();
    ASSERT_EQ(record("com.parent", groups(R"(["group.p"])")), TarnSuccess);
    ASSERT_EQ(record("com.parent", groups(R"(["group.p"])")), TarnSuccess);
    EXPECT_EQ(storeWritesFor("com.parent"), 1u);

    const std::string child = R"("com.ostrea.TarnKeeper.ParentBundleID": "com.parent", )"
                              R"("com.ostrea.TarnKeeper.DataContainerClass": 4)";
    ASSERT_EQ(record("com.parent.ext", "{}", child), TarnSuccess);
    ASSERT_EQ(record("com.parent.ext", "{}", child), TarnSuccess);
    EXPECT_EQ(readInfo("com.parent.ext"), TarnSuccess);

    // Staging the parent's bundle for deletion takes its children's records
    // with its own.
    ASSERT_EQ(create("com.parent", 1), TarnSuccess);
    ASSERT_EQ(ask(R"({"Command": 10, "ContainerClass": 1, "Identifier": "com.parent"})"),
              TarnSuccess);
    EXPECT_EQ(readInfo("com.parent"), TarnErrorNotFound);
    EXPECT_EQ(readInfo("com.parent.ext"), TarnErrorNotFound);
}

TEST_F(CodeSigningCommandsTest, TheChildIsListedOnceUnderItsParent) {
    daemon_->start();
    ASSERT_EQ(record("com.parent", "{}"), TarnSuccess);
    const std::string child = R"("com.ostrea.TarnKeeper.ParentBundleID": "com.parent")";
    for (int i = 0; i < 3; ++i) ASSERT_EQ(record("com.parent.ext", "{}", child), TarnSuccess);
    ASSERT_EQ(daemon_->stop(), 0);

    auto store =
        TarnSQLiteDB::initWithParentDirectoryURL(root_.at("/private/var/root/Library/TarnKeeper"));
    ASSERT_TRUE(store);
    auto children = store->childIdentifiersForParentIdentifier("com.parent");
    ASSERT_TRUE(children.ok());
    EXPECT_EQ(*children, std::vector<std::string>{"com.parent.ext"});
}

TEST_F(CodeSigningCommandsTest, InvalidationAndWhatClientsMayRead) {
    daemon_->start();
    // Installed apps: one with its bundle container, one without.
    ASSERT_EQ(record("com.installed", "{}"), TarnSuccess);
    ASSERT_EQ(create("com.installed", 1), TarnSuccess);
    ASSERT_EQ(record("com.gone", "{}"), TarnSuccess);
    // Kept without a bundle: a caller-registered entry, a plug-in with a parent.
    ASSERT_EQ(record("com.self", "{}", R"("RegByCaller": true)"), TarnSuccess);
    ASSERT_EQ(record("com.installed.ext", "{}",
                     R"("com.ostrea.TarnKeeper.ParentBundleID": "com.installed", )"
                     R"("com.ostrea.TarnKeeper.DataContainerClass": 4)"),
              TarnSuccess);

    ASSERT_EQ(ask(R"({"Command": 20})"), TarnSuccess);
    EXPECT_EQ(readInfo("com.installed"), TarnSuccess);
    EXPECT_EQ(readInfo("com.gone"), TarnErrorNotFound) << "invalid entries are hidden";
    EXPECT_EQ(readInfo("com.self"), TarnSuccess);
    EXPECT_EQ(readInfo("com.installed.ext"), TarnSuccess);

    // Placeholders and advance copies are not for clients either.
    ASSERT_EQ(
        record("com.placeholder", "{}", R"("com.ostrea.TarnKeeper.PlaceholderEntitlements": true)"),
        TarnSuccess);
    ASSERT_EQ(record("com.advance", "{}", R"("com.ostrea.TarnKeeper.AdvanceCopy": true)"),
              TarnSuccess);
    EXPECT_EQ(readInfo("com.placeholder"), TarnErrorNotFound);
    EXPECT_EQ(readInfo("com.advance"), TarnErrorNotFound);
}

TEST_F(CodeSigningCommandsTest, InformationKeptInABundleIsImportedOnceOnAMiss) {
    daemon_->start();
    PlistValue made = send(
        admin_,
        R"({"Command": 0, "CreateIfNecessary": true, "ContainerClass": 1, "Identifier": "com.old"})");
    ASSERT_EQ(errorOf(made), TarnSuccess);
    const PlistValue* uuid = made.find("ReplyUUID");
    ASSERT_TRUE(uuid && uuid->asUuid());
    ASSERT_EQ(
        ask(R"({"Command": 5, "ContainerClass": 1, "Identifier": "com.old", "UUID": {"$uuid": ")" +
            uuid->asUuid()->string() +
            R"("}, "Key": "com.ostrea.Pallet.CachedCodeSigningInfo", "Value": )"
            R"({"Entitlements": {"com.ostrea.security.application-groups": ["group.old"]}}})"),
        TarnSuccess);

    for (int i = 0; i < 2; ++i) {
        PlistValue read = send(admin_, R"({"Command": 19, "Identifier": "com.old"})");
        ASSERT_EQ(errorOf(read), TarnSuccess);
        const PlistValue* info = read.find("ReplyInfoDictionary");
        ASSERT_TRUE(info);
        const PlistValue* entitlements = info->find("com.ostrea.TarnKeeper.Entitlements");
        ASSERT_TRUE(entitlements && entitlements->isDict()) << info->description();
    }
    EXPECT_EQ(countIn(diskLog(),
                      "Migrating code signing info from bundle container upon "
                      "request for com.old"),
              1u);
    PlistValue listed = send(admin_, R"({"Command": 14, "Identifier": "com.old"})");
    ASSERT_EQ(errorOf(listed), TarnSuccess);
    const PlistValue* ids = listed.find("ReplyGroupIdentifiersArray");
    ASSERT_TRUE(ids && ids->asArray());
    ASSERT_EQ(ids->asArray()->size(), 1u);
    EXPECT_EQ(*(*ids->asArray())[0].asString(), "group.old");
}

TEST_F(CodeSigningCommandsTest, TheGateRegistersACallerOnceAndBadInputChangesNothing) {
    PlistValue entitlements{PlistDict{}};
    entitlements.set("com.ostrea.private.TarnKeeper.allowed", true);
    entitlements.set("com.ostrea.security.application-groups", PlistArray{PlistValue("group.reg")});
    const std::string client = daemon_->addClient("reg", "com.ostrea.test.reg", entitlements);
    daemon_->start();

    for (int i = 0; i < 3; ++i) ASSERT_EQ(errorOf(send(client, R"({"Command": 14})")), TarnSuccess);
    EXPECT_EQ(storeWritesFor("com.ostrea.test.reg"), 1u) << "registered once, then unchanged";
    PlistValue listed = send(client, R"({"Command": 14})");
    const PlistValue* ids = listed.find("ReplyGroupIdentifiersArray");
    ASSERT_TRUE(ids && ids->asArray());
    ASSERT_EQ(ids->asArray()->size(), 1u);
    EXPECT_EQ(*(*ids->asArray())[0].asString(), "group.reg");

    // Installer information is never replaced by the caller's own.
    ASSERT_EQ(record("com.ostrea.test.reg", groups(R"(["group.installer"])")), TarnSuccess);
    listed = send(client, R"({"Command": 14})");
    ids = listed.find("ReplyGroupIdentifiersArray");
    ASSERT_TRUE(ids && ids->asArray() && ids->asArray()->size() == 1u);
    EXPECT_EQ(*(*ids->asArray())[0].asString(), "group.installer");

    // Malformed requests are refused and leave the record as it was.
    const char* malformed[] = {
        R"({"Command": 18, "Identifier": "com.ostrea.test.reg", "CodeSigningInfo": "text"})",
        R"({"Command": 18, "Identifier": "com.ostrea.test.reg", "CodeSigningInfo": {}, "OptionsDictionary": [1]})",
        R"({"Command": 18, "Identifier": "com.ostrea.test.reg", "CodeSigningInfo": {"com.ostrea.TarnKeeper.Entitlements": 5}})",
        R"({"Command": 18, "Identifier": "com.ostrea.test.reg", "CodeSigningInfo": {}, "OptionsDictionary": {"com.ostrea.TarnKeeper.DataContainerClass": "two"}})",
        R"({"Command": 18, "Identifier": "com.ostrea.test.reg", "CodeSigningInfo": {}, "OptionsDictionary": {"com.ostrea.TarnKeeper.DataContainerClass": 99}})",
        R"({"Command": 18, "Identifier": "com.ostrea.test.reg", "CodeSigningInfo": {}, "OptionsDictionary": {"RegByCaller": "yes"}})",
        R"({"Command": 18, "Identifier": "com.ostrea.test.reg", "CodeSigningInfo": {}, "OptionsDictionary": {"com.ostrea.TarnKeeper.ParentBundleID": {"a": 1}}})",
    };
    for (const char* request : malformed)
        EXPECT_EQ(ask(request), TarnErrorInvalidArgument) << request;
    EXPECT_EQ(ask(R"({"Command": 18, "CodeSigningInfo": {}})"), TarnErrorMissingIdentifier);
    listed = send(client, R"({"Command": 14})");
    ids = listed.find("ReplyGroupIdentifiersArray");
    ASSERT_TRUE(ids && ids->asArray() && ids->asArray()->size() == 1u);
    EXPECT_EQ(*(*ids->asArray())[0].asString(), "group.installer");
}

// The daemon dies after the new entitlements are stored and before the group
// they dropped is staged: nothing still referenced is lost, and the dropped
// group waits for the next reconciliation instead of vanishing half-way.
TEST_F(CodeSigningCommandsTest, ACrashBeforeTheQueuedDeletionLosesNothing) {
    // Arm this process's failpoints now, so that the variable set for the
    // daemon below is never read here.
    FailpointClearAll();
    daemon_->start();
    ASSERT_EQ(record("com.a", groups(R"(["group.solo", "group.shared"])")), TarnSuccess);
    ASSERT_EQ(record("com.b", groups(R"(["group.shared"])")), TarnSuccess);
    ASSERT_EQ(create("group.solo", 7), TarnSuccess);
    ASSERT_EQ(create("group.shared", 7), TarnSuccess);
    ASSERT_EQ(daemon_->stop(), 0);

    // The first move of the next launch is the staging of group.solo.
    ::setenv("TARN_FAILPOINTS", "fm.move=kill@1", 1);
    daemon_->start();
    ::unsetenv("TARN_FAILPOINTS");
    EXPECT_EQ(
        daemon_->sendError(admin_, R"({"Command": 18, "Identifier": "com.a", )"
                                   R"("CodeSigningInfo": {"com.ostrea.TarnKeeper.Entitlements": )"
                                   R"({"com.ostrea.security.application-groups": []}}})"),
        0u)
        << "no reply: the daemon died in the staging";
    daemon_->kill9();

    daemon_->start();
    EXPECT_EQ(lookUp("group.shared", 7), TarnSuccess);
    EXPECT_EQ(lookUp("group.solo", 7), TarnSuccess) << "unreferenced, not lost";
    PlistValue listed = send(admin_, R"({"Command": 14, "Identifier": "com.a"})");
    const PlistValue* ids = listed.find("ReplyGroupIdentifiersArray");
    ASSERT_TRUE(ids && ids->asArray());
    EXPECT_TRUE(ids->asArray()->empty()) << "the new entitlements were stored";
}

}  // namespace
}  // namespace tarn
