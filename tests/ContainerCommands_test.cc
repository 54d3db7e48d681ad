// The container commands over IPC: create or look up, list, stage for
// deletion, delete, death row, metadata, and sandbox tokens for personas.
#include <gtest/gtest.h>

#include <filesystem>
#include <future>
#include <map>
#include <set>

#include "Daemon/TarnError.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Tools/tarnctl/Json.h"
#include "support/DaemonHarness.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using test::DaemonHarness;

constexpr const char* kPersonal = "PERSONAL-0000";
constexpr const char* kEnterprise = "ENTERPRISE-0001";

class ContainerCommandsTest : public test::IpcTest {
  protected:
    // One enterprise persona, listing com.ostrea.test.ent.
    void enablePersonas() {
        IpcTest::enablePersonas(
            {{kEnterprise, 1001, "/private/var/personas/enterprise", {"com.ostrea.test.ent"}}});
    }

    static std::string uuidOf(const PlistValue& reply) {
        const PlistValue* v = reply.find("ReplyUUID");
        return v && v->asUuid() ? v->asUuid()->string() : std::string();
    }
    // Creates (or finds) an application data container and returns the reply.
    PlistValue create(const std::string& identifier, bool transient = false) {
        return send(admin_, R"({"Command": 0, "ContainerClass": 2, "CreateIfNecessary": true, )"
                            R"("Transient": )" +
                                std::string(transient ? "true" : "false") + R"(, "Identifier": ")" +
                                identifier + R"("})");
    }
    size_t deathRowCount() {
        FileURL dir = TarnGlobalConfiguration::sharedInstance().deathrowDirectory();
        std::error_code ec;
        size_t n = 0;
        for (auto it = fs::directory_iterator(dir, ec); !ec && it != fs::directory_iterator(); ++it)
            ++n;
        return n;
    }
};

TEST_F(ContainerCommandsTest, CreateLookUpAndRefuseBadIdentities) {
    std::string guest =
        daemon_->addClient("guest", "com.ostrea.test.guest", PlistValue(PlistDict{}));
    daemon_->start();

    // Looking up a missing container without creating it leaves nothing behind.
    EXPECT_EQ(
        errorOf(send(admin_, R"({"Command": 0, "ContainerClass": 2, "Identifier": "com.a"})")),
        TarnErrorNotFound);
    const std::string createA =
        R"({"Command": 0, "CreateIfNecessary": true, "Identifier": "com.a")";
    EXPECT_EQ(errorOf(send(admin_, createA + R"(, "ContainerClass": 0})")),
              TarnErrorInvalidContainerClass);
    EXPECT_EQ(errorOf(send(admin_, createA + R"(, "ContainerClass": 14})")),
              TarnErrorInvalidContainerClass);
    const std::string live = root_.at("/private/var/mobile/Containers/Data/Application");
    EXPECT_TRUE(!fs::exists(live) || fs::is_empty(live));

    PlistValue made = create("com.a");
    ASSERT_EQ(errorOf(made), TarnSuccess);
    const std::string path = stringOf(made, "ReplyPath");
    EXPECT_TRUE(fs::is_directory(path)) << path;
    EXPECT_EQ(made.find("ReplyExisted")->asBool(), false);
    EXPECT_EQ(stringOf(made, "ReplyIdentifier"), "com.a");
    EXPECT_FALSE(made.find("ReplySandboxToken")) << "the caller is not sandboxed";

    PlistValue found =
        send(admin_, R"({"Command": 0, "ContainerClass": 2, "Identifier": "com.a"})");
    EXPECT_EQ(found.find("ReplyExisted")->asBool(), true);
    EXPECT_EQ(stringOf(found, "ReplyPath"), path);
    EXPECT_EQ(uuidOf(found), uuidOf(made));

    // Without "Identifier" a client without entitlements gets its own
    // container, and nobody else's.
    PlistValue own =
        send(guest, R"({"Command": 0, "ContainerClass": 2, "CreateIfNecessary": true})");
    EXPECT_EQ(errorOf(own), TarnSuccess);
    EXPECT_EQ(stringOf(own, "ReplyIdentifier"), "com.ostrea.test.guest");
    EXPECT_EQ(errorOf(send(guest, R"({"Command": 0, "ContainerClass": 2, "Identifier": "com.a"})")),
              TarnErrorNotEntitled);
}

TEST_F(ContainerCommandsTest, ConcurrentCreationsMakeOneContainerAndTransientsAreAlwaysNew) {
    std::string other = daemon_->addPrivilegedClient("admin2");
    daemon_->start();

    const std::string request =
        R"({"Command": 0, "ContainerClass": 2, "CreateIfNecessary": true, "Identifier": "com.race"})";
    auto run = [&](const std::string& client) {
        auto r = daemon_->tarnctl(client, {"send", request});
        std::string why;
        return tarnctl::JsonToPlist(r.out, &why).value_or(PlistValue(PlistDict{}));
    };
    auto first = std::async(std::launch::async, run, admin_);
    auto second = std::async(std::launch::async, run, other);
    PlistValue a = first.get(), b = second.get();
    ASSERT_EQ(errorOf(a), TarnSuccess);
    ASSERT_EQ(errorOf(b), TarnSuccess);
    EXPECT_EQ(uuidOf(a), uuidOf(b));
    EXPECT_EQ(stringOf(a, "ReplyPath"), stringOf(b, "ReplyPath"));
    std::multiset<bool> existed = {*a.find("ReplyExisted")->asBool(),
                                   *b.find("ReplyExisted")->asBool()};
    EXPECT_EQ(existed, (std::multiset<bool>{false, true})) << "one made it, the other found it";

    std::set<std::string> paths, uuids;
    for (int i = 0; i < 3; ++i) {
        PlistValue t = create("com.transient", /*transient=*/true);
        ASSERT_EQ(errorOf(t), TarnSuccess);
        paths.insert(stringOf(t, "ReplyPath"));
        uuids.insert(uuidOf(t));
    }
    EXPECT_EQ(paths.size(), 3u);
    EXPECT_EQ(uuids.size(), 3u);
}

TEST_F(ContainerCommandsTest, ListDeleteAndEmptyDeathRow) {
    daemon_->start();
    std::map<std::string, std::string> made;  // identifier -> UUID
    for (const char* id : {"com.list.one", "com.list.two"}) {
        PlistValue r = create(id);
        ASSERT_EQ(errorOf(r), TarnSuccess);
        made[id] = uuidOf(r);
    }

    PlistValue list = send(admin_, R"({"Command": 1, "ContainerClass": 2})");
    ASSERT_EQ(errorOf(list), TarnSuccess);
    const PlistArray* ids = list.find("ReplyIdsArray")->asArray();
    const PlistArray* uuids = list.find("ReplyUUIDsArray")->asArray();
    const PlistArray* personas = list.find("ReplyPersonaUniqueStringsArray")->asArray();
    ASSERT_TRUE(ids && uuids && personas);
    ASSERT_EQ(ids->size(), uuids->size());
    ASSERT_EQ(ids->size(), personas->size());
    std::map<std::string, std::string> listed;
    for (size_t i = 0; i < ids->size(); ++i)
        listed[*(*ids)[i].asString()] = (*uuids)[i].asUuid()->string();
    for (const auto& [id, uuid] : made) EXPECT_EQ(listed[id], uuid) << id;
    EXPECT_EQ(errorOf(send(admin_, R"({"Command": 1, "ContainerClass": 99})")),
              TarnErrorInvalidArgument);

    // Deletion moves the container to death row; command 4 empties it and
    // answers from the pass's completion.
    const std::string path = stringOf(create("com.list.one"), "ReplyPath");
    EXPECT_EQ(errorOf(send(admin_, R"({"Command": 10, "ContainerClass": 2})")),
              TarnErrorMissingIdentifier)
        << "deletion never defaults to the caller's own container";
    ASSERT_EQ(errorOf(send(
                  admin_, R"({"Command": 10, "ContainerClass": 2, "Identifier": "com.list.one"})")),
              TarnSuccess);
    EXPECT_FALSE(fs::exists(path));
    EXPECT_EQ(errorOf(send(admin_,
                           R"({"Command": 0, "ContainerClass": 2, "Identifier": "com.list.one"})")),
              TarnErrorNotFound);
    EXPECT_GE(deathRowCount(), 1u);
    EXPECT_EQ(errorOf(send(
                  admin_, R"({"Command": 10, "ContainerClass": 2, "Identifier": "com.list.one"})")),
              TarnErrorNotFound);

    PlistValue emptied = send(admin_, R"({"Command": 4})");
    EXPECT_EQ(errorOf(emptied), TarnSuccess);
    EXPECT_EQ(deathRowCount(), 0u);
}

TEST_F(ContainerCommandsTest, StageForDeleteIsAllOrNothingOnBadInput) {
    enablePersonas();
    daemon_->start();
    PlistValue made = create("com.stage");
    ASSERT_EQ(errorOf(made), TarnSuccess);
    const std::string path = stringOf(made, "ReplyPath");
    const std::string uuid = uuidOf(made);
    auto stage = [&](const std::string& classes, const std::string& uuids, const std::string& ids,
                     const std::string& personas) {
        return errorOf(send(admin_, R"({"Command": 3, "ContainerClassesArray": )" + classes +
                                        R"(, "UUIDsArray": )" + uuids +
                                        R"(, "IdentifiersArray": )" + ids +
                                        R"(, "PersonaUniqueStringsArray": )" + personas + "}"));
    };
    const std::string u = R"({"$uuid": ")" + uuid + R"("})";
    const std::string other = R"({"$uuid": "00000000-0000-0000-0000-00000000000A"})";

    EXPECT_EQ(stage("[2, 2, 2]", "[" + u + ", " + other + "]", R"(["com.stage", "x", "y"])",
                    R"([")" + std::string(kPersonal) + R"(", "", ""])"),
              TarnErrorBadInput);
    EXPECT_TRUE(fs::is_directory(path)) << "nothing staged after a count mismatch";

    EXPECT_EQ(stage("[2, 2]", "[" + u + ", " + other + "]", R"(["com.stage", "x"])",
                    R"([")" + std::string(kPersonal) + R"(", "NO-SUCH-PERSONA"])"),
              TarnErrorPersonaMismatch);
    EXPECT_TRUE(fs::is_directory(path)) << "nothing staged after a bad persona";

    EXPECT_EQ(
        stage("[2]", "[" + u + "]", R"(["com.stage"])", R"([")" + std::string(kPersonal) + R"("])"),
        TarnSuccess);
    EXPECT_FALSE(fs::exists(path));
}

TEST_F(ContainerCommandsTest, MetadataReturnsInfoOnlyWhenAsked) {
    daemon_->start();
    PlistValue made = create("com.meta");
    ASSERT_EQ(errorOf(made), TarnSuccess);
    const std::string concrete =
        R"("Identifier": "com.meta", "ContainerClass": 2, "UUID": {"$uuid": ")" + uuidOf(made) +
        R"("})";
    ASSERT_EQ(errorOf(send(
                  admin_, R"({"Command": 5, "Key": "Colour", "Value": "teal", )" + concrete + "}")),
              TarnSuccess);

    PlistValue plain =
        send(admin_, R"({"Command": 7, "InfoDictRequested": false, )" + concrete + "}");
    ASSERT_EQ(errorOf(plain), TarnSuccess);
    EXPECT_EQ(stringOf(plain, "ReplyPath"), stringOf(made, "ReplyPath"));
    EXPECT_EQ(plain.find("ReplyTransient")->asBool(), false);
    EXPECT_FALSE(plain.find("ReplyInfoDictionary"));

    PlistValue withInfo =
        send(admin_, R"({"Command": 7, "InfoDictRequested": true, )" + concrete + "}");
    ASSERT_EQ(errorOf(withInfo), TarnSuccess);
    ASSERT_TRUE(withInfo.find("ReplyInfoDictionary"));
    EXPECT_EQ(stringOf(*withInfo.find("ReplyInfoDictionary"), "Colour"), "teal");
}

TEST_F(ContainerCommandsTest, SandboxTokensOnlyForEnterpriseContainers) {
    enablePersonas();
    const PlistValue none{PlistDict{}};
    std::string enterprise =
        daemon_->addClient("ent", "com.ostrea.test.ent", none, /*sandboxed=*/true, kEnterprise);
    std::string personal =
        daemon_->addClient("per", "com.ostrea.test.per", none, /*sandboxed=*/true, kPersonal);
    daemon_->start();

    const std::string own = R"({"Command": 0, "ContainerClass": 2, "CreateIfNecessary": true})";
    PlistValue p = send(personal, own);
    ASSERT_EQ(errorOf(p), TarnSuccess);
    EXPECT_FALSE(p.find("ReplySandboxToken")) << "a personal container is in the common sandbox";
    EXPECT_EQ(stringOf(p, "ReplyPersonaUniqueString"), kPersonal);

    PlistValue e = send(enterprise, own);
    ASSERT_EQ(errorOf(e), TarnSuccess);
    EXPECT_EQ(stringOf(e, "ReplyPersonaUniqueString"), kEnterprise);
    const std::string token = stringOf(e, "ReplySandboxToken");
    EXPECT_EQ(token.rfind("1;com.ostrea.sandbox.container;", 0), 0u) << token;
    EXPECT_NE(stringOf(e, "ReplyPath"), stringOf(p, "ReplyPath"));
}

}  // namespace
}  // namespace tarn
