// Wiping data containers as clients see it (commands 11 and 12) and the
// replace command (2) through the running daemon: who may wipe what, and
// what a wiped container keeps and loses.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnError.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

class WipeTest : public test::IpcTest {
  protected:
    struct Container {
        std::string path;
        std::string uuid;
    };

    // Command 0 as the admin; the container is created when missing.
    Container container(const std::string& identifier, TarnContainerClass c,
                        bool transient = false) {
        const PlistValue reply = send(admin_, "{\"Command\": 0, \"Identifier\": \"" + identifier +
                                                  "\", \"ContainerClass\": " + std::to_string(c) +
                                                  ", \"CreateIfNecessary\": true, \"Transient\": " +
                                                  (transient ? "true" : "false") + "}");
        EXPECT_EQ(errorOf(reply), TarnSuccess) << identifier;
        const PlistValue* uuid = reply.find("ReplyUUID");
        return {stringOf(reply, "ReplyPath"),
                uuid && uuid->asUuid() ? uuid->asUuid()->string() : std::string()};
    }

    static std::string wipe(int command, const std::string& identifier, TarnContainerClass c) {
        return "{\"Command\": " + std::to_string(command) + ", \"Identifier\": \"" + identifier +
               "\", \"ContainerClass\": " + std::to_string(c) + "}";
    }

    // Content a wipe must take: a plain file, and a read-only file inside a
    // read-only directory.
    static void fill(const std::string& path) {
        std::ofstream(path + "/Documents/note") << "note";
        fs::create_directories(path + "/Library/locked");
        std::ofstream(path + "/Library/locked/frozen") << "frozen";
        ::chmod((path + "/Library/locked/frozen").c_str(), 0400);
        ::chmod((path + "/Library/locked").c_str(), 0500);
    }

    // Waits for the deletion passes queued so far (command 4 answers after its own).
    void drainDeathRow() { EXPECT_EQ(ask(admin_, R"({"Command": 4})"), TarnSuccess); }

    // The wiped container: same path and UUID, metadata and default
    // structure, none of the old content anywhere on death row.
    void expectWiped(const Container& before, const std::string& identifier, TarnContainerClass c) {
        const Container after = container(identifier, c);
        EXPECT_EQ(after.path, before.path);
        EXPECT_EQ(after.uuid, before.uuid);
        EXPECT_TRUE(fs::exists(after.path + "/.com.ostrea.tarn_keeper.metadata.plist"));
        EXPECT_TRUE(fs::is_directory(after.path + "/Documents"));
        EXPECT_TRUE(fs::is_directory(after.path + "/Library"));
        EXPECT_FALSE(fs::exists(after.path + "/Documents/note"));
        EXPECT_FALSE(fs::exists(after.path + "/Library/locked"));
        drainDeathRow();
        const std::string deathRow =
            root_.at("/private/var/root/Library/Caches/com.ostrea.tarnkeeperd/Dead");
        if (fs::exists(deathRow))
            for (const auto& e : fs::recursive_directory_iterator(deathRow))
                EXPECT_NE(e.path().filename(), "frozen") << e.path();
        // Metadata request by the kept UUID finds it.
        EXPECT_EQ(ask(admin_, "{\"Command\": 7, \"Identifier\": \"" + identifier +
                                  "\", \"ContainerClass\": " + std::to_string(c) +
                                  ", \"UUID\": {\"$uuid\": \"" + before.uuid + "\"}}"),
                  TarnSuccess);
    }
};

TEST_F(WipeTest, EntitledClientWipesListedPluginDataAndNothingElse) {
    if (IsSkipped()) return;
    PlistValue entitlements{PlistDict{}};
    entitlements.set("com.ostrea.private.TarnKeeper.wipeContainer",
                     PlistArray{PlistValue("com.wipe.plugin"), PlistValue(uint64_t{3})});
    const std::string wiper =
        daemon_->addClient("wiper", "com.wipe.wiper", entitlements, /*sandboxed=*/false);
    daemon_->start();

    const Container plugin = container("com.wipe.plugin", 4);
    const Container other = container("com.wipe.other", 4);
    fill(plugin.path);
    fill(other.path);

    EXPECT_EQ(ask(wiper, wipe(11, "com.wipe.plugin", 4)), TarnSuccess);
    expectWiped(plugin, "com.wipe.plugin", 4);

    EXPECT_EQ(ask(wiper, wipe(11, "com.wipe.other", 4)), TarnErrorNotEntitled);
    EXPECT_TRUE(fs::exists(other.path + "/Documents/note"));
    // Command 12 needs its own entitlement.
    EXPECT_EQ(ask(wiper, wipe(12, "com.wipe.other", 4)), TarnErrorNotEntitled);
    EXPECT_EQ(ask(wiper, R"({"Command": 11})"), TarnErrorMissingIdentifier);
    EXPECT_TRUE(fs::exists(other.path + "/Documents/note"));
    EXPECT_NE(daemon_->platformLog().find("Not entitled to wipe container with identifier"),
              std::string::npos);
}

TEST_F(WipeTest, ContentDeleterWipesAnyDataClassButNoBundle) {
    if (IsSkipped()) return;
    PlistValue entitlements{PlistDict{}};
    entitlements.set("com.ostrea.private.TarnKeeper.deleteContainerContent", true);
    const std::string deleter = daemon_->addClient("deleter", "com.wipe.deleter", entitlements);
    daemon_->start();

    for (TarnContainerClass c : {TarnContainerClass{2}, TarnContainerClass{10}}) {
        SCOPED_TRACE(c);
        const std::string id = "com.wipe.data" + std::to_string(c);
        const Container data = container(id, c);
        fill(data.path);
        EXPECT_EQ(ask(deleter, wipe(12, id, c)), TarnSuccess);
        expectWiped(data, id, c);
    }

    const Container bundle = container("com.wipe.bundle", 1);
    std::ofstream(bundle.path + "/payload") << "payload";
    EXPECT_EQ(ask(deleter, wipe(12, "com.wipe.bundle", 1)), TarnErrorInvalidArgument);
    EXPECT_EQ(ask(deleter, wipe(12, "com.wipe.nothing", 2)), TarnErrorNotFound);
    EXPECT_EQ(ask(deleter, R"({"Command": 12, "ContainerClass": 2})"), TarnErrorMissingIdentifier);
    EXPECT_TRUE(fs::exists(bundle.path + "/payload"));
}

TEST_F(WipeTest, ReplaceCommandMovesTheNewContainerIntoTheOldOnesTree) {
    if (IsSkipped()) return;
    daemon_->start();
    const Container old = container("com.replace.ipc", 2);
    const Container neu = container("com.replace.ipc", 2, /*transient=*/true);
    std::ofstream(neu.path + "/new") << "new";
    const std::string request =
        "{\"Command\": 2, \"OldIdentifier\": \"com.replace.ipc\", \"OldContainerClass\": 2, "
        "\"OldContainerUUID\": {\"$uuid\": \"" +
        old.uuid +
        "\"}, \"NewIdentifier\": \"com.replace.ipc\", \"NewContainerClass\": 2, "
        "\"NewContainerUUID\": {\"$uuid\": \"" +
        neu.uuid + "\"}}";
    ASSERT_EQ(ask(admin_, request), TarnSuccess);
    const Container after = container("com.replace.ipc", 2);
    EXPECT_EQ(after.uuid, neu.uuid);
    EXPECT_EQ(fs::path(after.path).filename(), fs::path(neu.path).filename());
    EXPECT_EQ(fs::path(after.path).parent_path(), fs::path(old.path).parent_path());
    EXPECT_TRUE(fs::exists(after.path + "/new"));
    EXPECT_FALSE(fs::exists(old.path));

    // No old identifier: a new container is promoted; none to promote: 21.
    const Container lone = container("com.replace.lone", 2, /*transient=*/true);
    EXPECT_EQ(ask(admin_,
                  "{\"Command\": 2, \"NewIdentifier\": \"com.replace.lone\", "
                  "\"NewContainerClass\": 2, \"NewContainerUUID\": {\"$uuid\": \"" +
                      lone.uuid + "\"}}"),
              TarnSuccess);
    EXPECT_EQ(ask(admin_, R"({"Command": 2, "NewContainerClass": 2})"), TarnErrorMissingIdentifier);
}

}  // namespace
}  // namespace tarn
