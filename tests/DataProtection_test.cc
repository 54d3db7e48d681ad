// Changing the data-protection class of a data container (command 21) as a
// client sees it, against the daemon process on a scratch root: refusals,
// which items each kind of change touches, waiting for an unlock, a newer
// change superseding an older one, and pending changes across a restart.
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "Daemon/TarnDataProtectionChangeOperation.h"
#include "Daemon/TarnDataProtectionManager.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/FileSystem.h"
#include "Platform/LockState.h"
#include "Tools/tarnctl/Json.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr const char* kApp = "com.example.vault";

class DataProtectionTest : public test::IpcTest {
  protected:
    void SetUp() override {
        IpcTest::SetUp();
        if (IsSkipped()) return;
        ASSERT_EQ(LockStateSet(0), 0);
        daemon_->start();
    }

    // Creates the application's data container; answers its path.
    std::string createContainer() {
        PlistValue reply =
            send(admin_, std::string("{\"Command\": 0, \"Identifier\": \"") + kApp +
                             "\", \"ContainerClass\": 2, \"CreateIfNecessary\": true}");
        EXPECT_EQ(errorOf(reply), TarnSuccess);
        uuid_ =
            reply.find("ReplyUUID") ? reply.find("ReplyUUID")->asUuid().value_or(Uuid{}) : Uuid{};
        return stringOf(reply, "ReplyPath");
    }

    static std::string request(int32_t dataProtectionClass, bool retry, bool thirdParty = false,
                               const char* identifier = kApp, int containerClass = 2) {
        return "{\"Command\": 21, \"Identifier\": \"" + std::string(identifier) +
               "\", \"ContainerClass\": " + std::to_string(containerClass) +
               ", \"DataProtectionClass\": " + std::to_string(dataProtectionClass) +
               ", \"IsThirdParty\": " + (thirdParty ? "true" : "false") +
               ", \"RetryIfLocked\": " + (retry ? "true" : "false") + "}";
    }

    // A request whose reply is awaited on another thread; "ReplyError", or 0
    // when no reply came (the daemon died).
    std::future<uint64_t> sendLater(const std::string& json) {
        return std::async(std::launch::async, [this, json] {
            test::ProcessResult r = daemon_->tarnctl(admin_, {"send", json});
            std::string why;
            auto reply = tarnctl::JsonToPlist(r.out, &why);
            return r.exitCode == 0 && reply ? errorOf(*reply) : uint64_t{0};
        });
    }

    std::string pendingDirectory() const {
        return root_.at("/private/var/root/Library/TarnKeeper/PendingUpdates");
    }
    std::vector<std::string> pendingFiles() const {
        std::vector<std::string> names;
        std::error_code ec;
        for (const auto& e : fs::directory_iterator(pendingDirectory(), ec))
            if (e.path().filename().string()[0] != '.') names.push_back(e.path().string());
        return names;
    }
    // Waits until the pending file names `internalID` changes from `previous`;
    // answers the new one ("" on timeout).
    std::string waitForPendingID(const std::string& previous) {
        for (auto deadline = std::chrono::steady_clock::now() + 10s;
             std::chrono::steady_clock::now() < deadline; std::this_thread::sleep_for(10ms)) {
            for (const std::string& file : pendingFiles()) {
                std::ifstream in(file, std::ios::binary);
                std::string bytes((std::istreambuf_iterator<char>(in)), {});
                auto d = PlistValue::fromBytes(bytes.data(), bytes.size());
                const PlistValue* id = d ? d->find(kTarnDataOperationInternalIDKey) : nullptr;
                if (id && id->asString() && *id->asString() != previous) return *id->asString();
            }
        }
        return "";
    }

    static int32_t classOf(const std::string& path) {
        FsFd fd;
        int32_t cls = -1;
        if (FsOpenItem(-1, path, &fd) == 0) (void)FsGetProtectionClass(fd.get(), &cls);
        return cls;
    }
    static void setClass(const std::string& path, int32_t cls) {
        FsFd fd;
        ASSERT_EQ(FsOpenItem(-1, path, &fd), 0) << path;
        ASSERT_EQ(FsSetProtectionClass(fd.get(), cls), 0) << path;
    }
    static void makeFile(const std::string& path, int32_t cls) {
        std::ofstream(path) << "data";
        if (cls) setClass(path, cls);
    }

    // The class the container's info records, or -1.
    int64_t recordedClass() {
        PlistValue reply = send(admin_, std::string("{\"Command\": 6, \"Identifier\": \"") + kApp +
                                            "\", \"ContainerClass\": 2, \"UUID\": {\"$uuid\": \"" +
                                            uuid_.string() + "\"}, \"Key\": \"" +
                                            kTarnInfoContentProtectionClassKey + "\"}");
        const PlistValue* v = reply.find("ReplyInfoValue");
        return v ? v->asInt64().value_or(-1) : -1;
    }

    std::string rotatingLog() const {
        std::ifstream in(root_.at("/private/var/root/Library/Logs/TarnKeeper/tarnkeeperd.log"));
        return std::string((std::istreambuf_iterator<char>(in)), {});
    }

    Uuid uuid_;
};

TEST_F(DataProtectionTest, RefusalsComeBeforeAnyChange) {
    createContainer();
    EXPECT_EQ(ask(admin_, request(1, false, false, "com.example.absent")), TarnErrorNotFound);
    EXPECT_EQ(ask(admin_, request(1, false, false, kApp, 1)), TarnErrorInvalidArgument)
        << "a bundle container has no protection class";
    EXPECT_EQ(ask(admin_, "{\"Command\": 21, \"ContainerClass\": 2}"), TarnErrorMissingIdentifier);
    EXPECT_EQ(ask(admin_, request(2, false, /*thirdParty=*/false)), TarnErrorBadInput);
    EXPECT_EQ(ask(admin_, request(2, false, /*thirdParty=*/true)), TarnErrorBadInput);
    EXPECT_EQ(ask(admin_, request(4, false, /*thirdParty=*/true)), TarnErrorBadInput);
    EXPECT_EQ(recordedClass(), -1) << "nothing recorded for a refused change";
    EXPECT_TRUE(pendingFiles().empty());
    EXPECT_EQ(ask(admin_, request(4, false, /*thirdParty=*/false)), TarnSuccess)
        << "a platform application may have class 4";
    EXPECT_EQ(recordedClass(), 4);
}

// Directories only when the class gets weaker; files too when it gets
// stronger, but never to a weaker class and never out of class 2.
TEST_F(DataProtectionTest, ChangeTypesDecideWhichItemsChange) {
    const std::string path = createContainer();
    const std::string docs = path + "/Documents";
    fs::create_directories(docs + "/locked-dir");
    setClass(docs + "/locked-dir", 2);
    makeFile(docs + "/none.txt", 4);
    makeFile(docs + "/complete.txt", 1);
    makeFile(docs + "/unclassed.txt", 0);
    makeFile(docs + "/unless-open.txt", 2);
    fs::create_symlink("/etc/passwd", docs + "/link");

    // None recorded -> 3: directories only.
    ASSERT_EQ(ask(admin_, request(3, false)), TarnSuccess);
    EXPECT_EQ(classOf(docs), 3);
    EXPECT_EQ(classOf(path + "/Library/Caches"), 3);
    EXPECT_EQ(classOf(docs + "/locked-dir"), 2);
    EXPECT_EQ(classOf(docs + "/none.txt"), 4);
    EXPECT_EQ(recordedClass(), 3);

    // 3 -> 1: stronger, files follow when that makes them stronger.
    ASSERT_EQ(ask(admin_, request(1, false)), TarnSuccess);
    EXPECT_EQ(classOf(docs), 1);
    EXPECT_EQ(classOf(path + "/tmp"), 1);
    EXPECT_EQ(classOf(docs + "/none.txt"), 1);
    EXPECT_EQ(classOf(docs + "/complete.txt"), 1);
    EXPECT_EQ(classOf(docs + "/unless-open.txt"), 2);
    EXPECT_EQ(classOf(docs + "/locked-dir"), 2);
    EXPECT_EQ(classOf(path + "/SystemData"), 0) << "not user data";
    EXPECT_EQ(recordedClass(), 1);

    // 1 -> 3: weaker, files keep their class.
    ASSERT_EQ(ask(admin_, request(3, false)), TarnSuccess);
    EXPECT_EQ(classOf(docs), 3);
    EXPECT_EQ(classOf(docs + "/complete.txt"), 1);
    EXPECT_EQ(recordedClass(), 3);
    EXPECT_TRUE(fs::is_symlink(docs + "/link"));
    EXPECT_TRUE(pendingFiles().empty());
}

// Locked without retry the change ends at once (61); with retry the reply
// waits for the unlock. Asking for the class the container already has
// drops a pending change without touching files, and the waiting change then
// finds itself superseded (69).
TEST_F(DataProtectionTest, LockedChangesWaitForTheUnlockOrFail) {
    const std::string path = createContainer();
    ASSERT_EQ(LockStateSet(1), 0);
    EXPECT_EQ(ask(admin_, request(1, /*retry=*/false)), TarnErrorLockedNotRetried);
    EXPECT_TRUE(pendingFiles().empty());

    std::future<uint64_t> waiting = sendLater(request(1, /*retry=*/true));
    ASSERT_NE(waitForPendingID(""), "");
    EXPECT_EQ(waiting.wait_for(300ms), std::future_status::timeout) << "answered while locked";
    ASSERT_EQ(LockStateSet(0), 0);
    ASSERT_EQ(waiting.wait_for(20s), std::future_status::ready);
    EXPECT_EQ(waiting.get(), TarnSuccess);
    for (const char* dir :
         {"/Documents", "/Library", "/Library/Caches", "/Library/Preferences", "/tmp"})
        EXPECT_EQ(classOf(path + dir), 1) << dir;
    EXPECT_EQ(recordedClass(), 1);
    EXPECT_TRUE(pendingFiles().empty());

    // A change away from class 1 touches class-1 items and so waits too;
    // asking meanwhile for class 1, which the container has, drops it.
    ASSERT_EQ(LockStateSet(1), 0);
    std::future<uint64_t> superseded = sendLater(request(4, /*retry=*/true));
    ASSERT_NE(waitForPendingID(""), "");
    EXPECT_EQ(ask(admin_, request(1, /*retry=*/false)), TarnSuccess) << "already class 1";
    EXPECT_TRUE(pendingFiles().empty());
    EXPECT_EQ(classOf(path + "/Documents"), 1);
    ASSERT_EQ(LockStateSet(0), 0);
    ASSERT_EQ(superseded.wait_for(20s), std::future_status::ready);
    EXPECT_EQ(superseded.get(), TarnErrorSuperseded);
    EXPECT_EQ(classOf(path + "/Documents"), 1);
    EXPECT_EQ(recordedClass(), 1);
}

// The older of two waiting changes ends with 69 and leaves the newer one's
// file: the newer then still finds itself current and succeeds.
TEST_F(DataProtectionTest, ANewerChangeSupersedesAWaitingOne) {
    createContainer();
    ASSERT_EQ(LockStateSet(1), 0);
    std::future<uint64_t> older = sendLater(request(1, true));
    const std::string olderID = waitForPendingID("");
    ASSERT_NE(olderID, "");
    std::future<uint64_t> newer = sendLater(request(1, true));
    ASSERT_NE(waitForPendingID(olderID), "");
    ASSERT_EQ(LockStateSet(0), 0);
    ASSERT_EQ(older.wait_for(20s), std::future_status::ready);
    ASSERT_EQ(newer.wait_for(20s), std::future_status::ready);
    EXPECT_EQ(older.get(), TarnErrorSuperseded);
    EXPECT_EQ(newer.get(), TarnSuccess);
    EXPECT_EQ(recordedClass(), 1);
    EXPECT_TRUE(pendingFiles().empty());
}

TEST_F(DataProtectionTest, ARestartFinishesAWaitingChange) {
    const std::string path = createContainer();
    ASSERT_EQ(LockStateSet(1), 0);
    std::future<uint64_t> lost = sendLater(request(1, true));
    ASSERT_NE(waitForPendingID(""), "");
    daemon_->kill9();
    EXPECT_EQ(lost.get(), 0u) << "no reply from a killed daemon";
    ASSERT_EQ(pendingFiles().size(), 1u);

    ASSERT_EQ(LockStateSet(0), 0);
    daemon_->start();
    EXPECT_TRUE(pendingFiles().empty());
    EXPECT_EQ(classOf(path + "/Documents"), 1);
    EXPECT_EQ(recordedClass(), 1);
    EXPECT_NE(rotatingLog().find("Found pending data protection operation at"), std::string::npos);
}

// Files that cannot be run are reported at start-up and left for inspection.
TEST_F(DataProtectionTest, PendingFilesThatCannotRunStayWhereTheyAre) {
    daemon_->stop();
    auto writePlist = [&](const std::string& name, const PlistValue& d) {
        auto bytes = d.toBinary();
        std::ofstream(pendingDirectory() + "/" + name, std::ios::binary)
            .write(reinterpret_cast<const char*>(bytes.data()),
                   static_cast<std::streamsize>(bytes.size()));
    };
    fs::create_directories(pendingDirectory());
    PlistValue valid{PlistDict{}};
    valid.set(kTarnDataOperationIdentifierKey, "com.example.gone");
    valid.set(kTarnDataOperationContainerClassKey, uint64_t{2});
    valid.set(kTarnDataOperationProtectionClassKey, int32_t{1});
    valid.set(kTarnDataOperationChangeTypeKey, uint32_t{7});
    valid.set(kTarnDataOperationRetryIfLockedKey, true);
    valid.set(kTarnDataOperationInternalIDKey, Uuid::generate().string());
    valid.set(kTarnDataOperationUserIdKey, uint64_t{501});
    writePlist("gone.plist", valid);
    PlistValue stringType = valid;
    stringType.set(kTarnDataOperationChangeTypeKey, "7");
    writePlist("string-type.plist", stringType);
    std::ofstream(pendingDirectory() + "/garbage.plist") << "not a property list";

    daemon_->start();
    EXPECT_EQ(pendingFiles().size(), 3u);
    const std::string log = rotatingLog();
    EXPECT_NE(log.find("Invalid update info change type: 7 at "), std::string::npos);
    EXPECT_NE(log.find("Failed to read update info at URL"), std::string::npos);
    EXPECT_NE(log.find("Failed to lookup container metadata from file userId: 501, identifier: "
                       "com.example.gone"),
              std::string::npos);
}

// A new container's data directories get the class its application's
// entitlements ask for.
TEST_F(DataProtectionTest, NewContainersTakeTheirClassFromEntitlements) {
    PlistValue ent{PlistDict{}};
    ent.set("com.ostrea.private.TarnKeeper.allowed", true);
    ent.set(kTarnDataProtectionClassEntitlement, kTarnFileProtectionComplete);
    const std::string app = daemon_->addClient("app", "com.example.entitled", ent);
    PlistValue reply =
        send(app, "{\"Command\": 0, \"ContainerClass\": 2, \"CreateIfNecessary\": true}");
    ASSERT_EQ(errorOf(reply), TarnSuccess);
    const std::string path = stringOf(reply, "ReplyPath");
    EXPECT_EQ(classOf(path + "/Documents"), 1);
    EXPECT_EQ(classOf(path + "/SystemData"), 0);
}

}  // namespace
}  // namespace tarn
