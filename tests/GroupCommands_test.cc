// Group, system-container and persona commands over IPC: a client's group
// containers (13), system container paths (15), system group containers (16,
// 17), the persona strings a client sees (32) and the crash-and-retry test
// hook (25) with the daemon restarted after each crash as its launcher would.
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <chrono>
#include <filesystem>
#include <set>
#include <thread>

#include "Daemon/TarnError.h"
#include "Daemon/TarnFileManager.h"
#include "support/DaemonHarness.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using test::DaemonHarness;

constexpr const char* kPersonal = "PERSONAL-0000";
constexpr const char* kEnterprise = "ENTERPRISE-0001";
constexpr const char* kSecondEnterprise = "ENTERPRISE-0002";

class GroupCommandsTest : public test::IpcTest {
  protected:
    // Two enterprise personas: com.ostrea.test.ent belongs to the first,
    // com.ostrea.test.both to both.
    void enablePersonas() {
        IpcTest::enablePersonas(
            {{kEnterprise,
              1001,
              "/private/var/personas/enterprise",
              {"com.ostrea.test.ent", "com.ostrea.test.both"}},
             {kSecondEnterprise, 1002, "/private/var/personas/second", {"com.ostrea.test.both"}}});
    }

    std::string addClient(const std::string& name, const std::string& identifier,
                          bool sandboxed = false,
                          std::optional<std::string> persona = std::nullopt) {
        return daemon_->addClient(name, identifier, PlistValue(PlistDict{}), sandboxed, persona);
    }

    // The string members of a reply dictionary, by key; empty when absent.
    static std::map<std::string, std::string> stringDict(const PlistValue& reply, const char* key) {
        std::map<std::string, std::string> out;
        const PlistValue* v = reply.find(key);
        if (!v || !v->asDict()) return out;
        for (const auto& [k, value] : *v->asDict())
            if (value.asString()) out[k] = *value.asString();
        return out;
    }
    static std::multiset<std::string> stringArray(const PlistValue& reply, const char* key) {
        std::multiset<std::string> out;
        const PlistValue* v = reply.find(key);
        if (!v || !v->asArray()) return out;
        for (const PlistValue& item : *v->asArray())
            if (item.asString()) out.insert(*item.asString());
        return out;
    }

    // Command 18 as the installer: `identifier` names these groups under `entitlement`.
    void recordGroups(const std::string& identifier, const char* entitlement,
                      const std::string& groupsJson) {
        ASSERT_EQ(
            errorOf(send(admin_,
                         R"({"Command": 18, "Identifier": ")" + identifier +
                             R"(", "CodeSigningInfo": {"com.ostrea.TarnKeeper.Entitlements": {")" +
                             entitlement + R"(": )" + groupsJson + "}}}")),
            TarnSuccess);
    }
    uint64_t systemGroupPath(const std::string& client, const std::string& group,
                             std::string* path = nullptr) {
        PlistValue reply =
            send(client, R"({"Command": 17, "GroupIdentifier": ")" + group + R"("})");
        if (path) *path = stringOf(reply, "ReplyPath");
        return errorOf(reply);
    }
};

TEST_F(GroupCommandsTest, SystemGroupPathIsForTheEntitledTheWellKnownAndSharedLogging) {
    const std::string guest = addClient("guest", "com.ostrea.test.guest");
    daemon_->start();

    // Without any entitlement: the shared logging group and the well-known
    // ones (under their fixed directory names).
    std::string path;
    ASSERT_EQ(systemGroupPath(guest, "systemgroup.com.ostrea.sharedpclogging", &path), TarnSuccess);
    EXPECT_TRUE(fs::is_directory(path)) << path;
    ASSERT_EQ(systemGroupPath(guest, "systemgroup.com.ostrea.analytics", &path), TarnSuccess);
    EXPECT_EQ(fs::path(path).filename(), "systemgroup.com.ostrea.analytics");
    EXPECT_TRUE(fs::is_directory(path)) << path;

    // Anything else is refused and never made.
    EXPECT_EQ(systemGroupPath(guest, "systemgroup.com.example.mine", &path), TarnErrorNotEntitled);
    EXPECT_TRUE(path.empty());
    EXPECT_EQ(errorOf(send(guest, R"({"Command": 17})")), TarnErrorNotEntitled);
    EXPECT_EQ(errorOf(send(admin_, R"({"Command": 0, "ContainerClass": 13, )"
                                   R"("Identifier": "systemgroup.com.example.mine"})")),
              TarnErrorNotFound);

    // Recorded for the client by the installer, it is the client's.
    recordGroups("com.ostrea.test.guest", "com.ostrea.security.system-groups",
                 R"(["systemgroup.com.example.mine"])");
    ASSERT_EQ(systemGroupPath(guest, "systemgroup.com.example.mine", &path), TarnSuccess);
    EXPECT_TRUE(fs::is_directory(path)) << path;
    // ...but not for an owner the client may not speak for.
    EXPECT_EQ(errorOf(send(guest, R"({"Command": 17, "GroupIdentifier": )"
                                  R"("systemgroup.com.example.mine", "Identifier": "com.other"})")),
              TarnErrorNotFound);
}

TEST_F(GroupCommandsTest, SystemContainersAndSystemGroupsOfAnOwner) {
    const std::string guest = addClient("guest", "com.ostrea.test.guest");
    daemon_->start();

    // Command 15: a well-known container of another identifier, by anyone.
    PlistValue wellKnown = send(guest, R"({"Command": 15, "Identifier": "com.ostrea.locationd"})");
    ASSERT_EQ(errorOf(wellKnown), TarnSuccess);
    EXPECT_EQ(fs::path(stringOf(wellKnown, "ReplyPath")).filename(), "com.ostrea.locationd");
    EXPECT_TRUE(fs::is_directory(stringOf(wellKnown, "ReplyPath")));
    EXPECT_EQ(errorOf(send(guest, R"({"Command": 15, "Identifier": "com.example.daemon"})")),
              TarnErrorNotEntitled);

    // Command 16: the owner's system groups, made on first use.
    recordGroups("com.ostrea.test.guest", "com.ostrea.security.system-groups",
                 R"(["systemgroup.com.example.a", "systemgroup.com.example.b"])");
    auto paths = stringDict(send(guest, R"({"Command": 16})"), "ReplyGroupContainerDict");
    ASSERT_EQ(paths.size(), 2u);
    for (const auto& [group, path] : paths) EXPECT_TRUE(fs::is_directory(path)) << group;
}

TEST_F(GroupCommandsTest, AClientsGroupsComeBackAndADamagedOneIsLeftOut) {
    const std::string app = addClient("app", "com.ostrea.test.app");
    const std::string guest = addClient("guest", "com.ostrea.test.guest");
    daemon_->start();
    recordGroups("com.ostrea.test.app", "com.ostrea.security.application-groups",
                 R"(["group.one", "group.two"])");

    PlistValue first = send(app, R"({"Command": 13})");
    ASSERT_EQ(errorOf(first), TarnSuccess);
    auto paths = stringDict(first, "ReplyGroupContainerDict");
    ASSERT_EQ(paths.size(), 2u);
    for (const auto& [group, path] : paths) EXPECT_TRUE(fs::is_directory(path)) << group;
    EXPECT_FALSE(first.find("ReplySandboxTokenDict")) << "the client is not sandboxed";
    EXPECT_FALSE(first.find("ReplyPersonaUniqueStringDict"));

    // group.two loses its metadata: this lookup leaves it out and still
    // succeeds; the next one makes it anew.
    fs::remove(fs::path(paths["group.two"]) / kTarnMetadataFileName);
    PlistValue damaged = send(app, R"({"Command": 13})");
    ASSERT_EQ(errorOf(damaged), TarnSuccess);
    EXPECT_EQ(stringDict(damaged, "ReplyGroupContainerDict"),
              (std::map<std::string, std::string>{{"group.one", paths["group.one"]}}));
    auto remade = stringDict(send(app, R"({"Command": 13})"), "ReplyGroupContainerDict");
    ASSERT_EQ(remade.size(), 2u);
    EXPECT_NE(remade["group.two"], paths["group.two"]);

    // Someone else's groups are not a client's to list.
    EXPECT_EQ(errorOf(send(guest, R"({"Command": 13, "Identifier": "com.ostrea.test.app"})")),
              TarnErrorNotEntitled);
}

TEST_F(GroupCommandsTest, GroupOwnersPersonaAndTokensForSandboxedClients) {
    enablePersonas();
    const std::string enterprise =
        addClient("ent", "com.ostrea.test.ent", /*sandboxed=*/true, kEnterprise);
    const std::string personal =
        addClient("per", "com.ostrea.test.per", /*sandboxed=*/true, kPersonal);
    const std::string entNoPersona = addClient("entany", "com.ostrea.test.ent");
    const std::string both = addClient("both", "com.ostrea.test.both");
    daemon_->start();
    for (const char* id : {"com.ostrea.test.ent", "com.ostrea.test.per", "com.ostrea.test.both"})
        recordGroups(id, "com.ostrea.security.application-groups",
                     R"(["group.shared.one", "group.shared.two"])");

    // A sandboxed enterprise client: a token and its persona for each group.
    PlistValue e = send(enterprise, R"({"Command": 13})");
    ASSERT_EQ(errorOf(e), TarnSuccess);
    auto entPaths = stringDict(e, "ReplyGroupContainerDict");
    ASSERT_EQ(entPaths.size(), 2u);
    auto tokens = stringDict(e, "ReplySandboxTokenDict");
    ASSERT_EQ(tokens.size(), 2u);
    for (const auto& [group, token] : tokens)
        EXPECT_EQ(token.rfind("1;com.ostrea.sandbox.application-group;", 0), 0u) << token;
    EXPECT_EQ(stringDict(e, "ReplyPersonaUniqueStringDict"),
              (std::map<std::string, std::string>{{"group.shared.one", kEnterprise},
                                                  {"group.shared.two", kEnterprise}}));

    // A sandboxed personal client: its own containers, reachable without a token.
    PlistValue p = send(personal, R"({"Command": 13})");
    ASSERT_EQ(errorOf(p), TarnSuccess);
    auto perPaths = stringDict(p, "ReplyGroupContainerDict");
    ASSERT_EQ(perPaths.size(), 2u);
    EXPECT_NE(perPaths["group.shared.one"], entPaths["group.shared.one"]);
    EXPECT_FALSE(p.find("ReplySandboxTokenDict"));
    EXPECT_EQ(stringDict(p, "ReplyPersonaUniqueStringDict").size(), 2u);

    // Without a persona of its own a client acts for its application's one...
    PlistValue any = send(entNoPersona, R"({"Command": 13})");
    ASSERT_EQ(errorOf(any), TarnSuccess);
    EXPECT_EQ(stringDict(any, "ReplyGroupContainerDict"), entPaths);
    // ...which must be one.
    PlistValue ambiguous = send(both, R"({"Command": 13})");
    EXPECT_EQ(errorOf(ambiguous), TarnErrorPersonaMismatch);
    EXPECT_FALSE(ambiguous.find("ReplyGroupContainerDict"));
}

TEST_F(GroupCommandsTest, PersonaStringsAClientSees) {
    // Without personas the client's identity has no persona string.
    const std::string plain = addClient("plain", "com.ostrea.test.plain");
    daemon_->start();
    PlistValue none = send(plain, R"({"Command": 32})");
    ASSERT_EQ(errorOf(none), TarnSuccess);
    ASSERT_TRUE(none.find("ReplyPersonaUniqueStringsArray"));
    EXPECT_TRUE(stringArray(none, "ReplyPersonaUniqueStringsArray").empty());
    ASSERT_EQ(daemon_->stop(), 0);

    enablePersonas();
    const std::string enterprise =
        addClient("ent", "com.ostrea.test.ent", /*sandboxed=*/false, kEnterprise);
    const std::string personal =
        addClient("per", "com.ostrea.test.per", /*sandboxed=*/false, kPersonal);
    daemon_->start();
    using Strings = std::multiset<std::string>;
    EXPECT_EQ(stringArray(send(enterprise, R"({"Command": 32})"), "ReplyPersonaUniqueStringsArray"),
              Strings{kEnterprise});
    EXPECT_EQ(stringArray(send(personal, R"({"Command": 32})"), "ReplyPersonaUniqueStringsArray"),
              Strings{kPersonal});
    EXPECT_EQ(stringArray(send(plain, R"({"Command": 32})"), "ReplyPersonaUniqueStringsArray"),
              (Strings{kPersonal, kEnterprise, kSecondEnterprise}));
}

class RetryTestCommandTest : public GroupCommandsTest {
  protected:
    // The launcher's part: once the daemon has ended on its own, reap it and
    // start it again. Answers its exit status, or -1 (and restarts nothing)
    // when it is still running after the timeout.
    int restartAfterExit(std::chrono::seconds timeout = std::chrono::seconds(15)) {
        const auto deadline = std::chrono::steady_clock::now() + timeout;
        int status = 0;
        while (::waitpid(daemon_->pid(), &status, WNOHANG) == 0) {
            if (std::chrono::steady_clock::now() > deadline) return -1;
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        daemon_->start();
        return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    }
    // "CrashCounter" of the retry container, or -1 when it does not exist.
    int64_t crashCounter() {
        PlistValue found = send(
            admin_, R"({"Command": 0, "ContainerClass": 2, "Identifier": "com.ostrea.retryTest"})");
        if (errorOf(found) != TarnSuccess) return -1;
        const PlistValue* uuid = found.find("ReplyUUID");
        if (!uuid || !uuid->asUuid()) return -1;
        PlistValue info =
            send(admin_, R"({"Command": 6, "ContainerClass": 2, )"
                         R"("Identifier": "com.ostrea.retryTest", "UUID": {"$uuid": ")" +
                             uuid->asUuid()->string() + R"("}, "Key": "CrashCounter"})");
        const PlistValue* value = info.find("ReplyInfoValue");
        return value && value->asUInt64() ? static_cast<int64_t>(*value->asUInt64()) : -1;
    }
    std::string addTester() {
        PlistValue entitlements{PlistDict{}};
        entitlements.set("com.ostrea.private.TarnKeeper.testability", true);
        return daemon_->addClient("tester", "com.ostrea.test.tester", entitlements);
    }
};

TEST_F(RetryTestCommandTest, TwoCrashesThenSuccessDeletesTheContainer) {
    // Only the testability entitlement: the hook's container is the daemon's own.
    const std::string tester = addTester();
    daemon_->start();
    const std::string request = R"({"Command": 25, "NumRetryCrashes": 2})";

    for (int64_t remaining : {2, 1}) {
        EXPECT_FALSE(daemon_->send(tester, request)) << "the daemon answers nothing, it ends";
        ASSERT_EQ(restartAfterExit(), 0) << "a clean exit, for the launcher to start it again";
        EXPECT_EQ(crashCounter(), remaining);
    }
    PlistValue done = send(tester, request);
    EXPECT_EQ(errorOf(done), TarnSuccess);
    EXPECT_EQ(crashCounter(), -1) << "the container is gone with the successful request";
}

TEST_F(RetryTestCommandTest, ACustomerBuildSucceedsAndDoesNothing) {
    PlistValue host{PlistDict{}};
    host.set("InternalBuild", false);
    daemon_->writeHostConfig(host);
    const std::string tester = addTester();
    daemon_->start();

    EXPECT_EQ(errorOf(send(tester, R"({"Command": 25, "NumRetryCrashes": 2})")), TarnSuccess);
    // The daemon still answers, and made no test container.
    EXPECT_EQ(crashCounter(), -1);
}

}  // namespace
}  // namespace tarn
