// A replacement never costs the old container, whatever moment the daemon
// dies at. For every step of a replacement (command 2) and of a wipe
// (command 12, which keeps the old directory, with and without a two-way
// rename), the daemon is killed just before that step and restarted; where a
// replace file was left, recovery itself is killed twice (before its restore
// rename, then before discarding the file) before a clean start. Then either
// the old container is back at its path with its contents, or the new one is
// at the destination and the old contents are gone once the start's clean-up
// has run, and no replace file is left.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <thread>

#include "Daemon/TarnError.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/Failpoints.h"
#include "Platform/FirstBootMarker.h"
#include "support/IpcTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr TarnContainerClass kAppData = 2;

// The steps in the order a replacement takes them; `arrived`: killed before
// it, the new container has reached its destination.
struct Step {
    const char* failpoint;
    bool arrived;
};
constexpr Step kSteps[] = {
    {"replace.writeFile", false},     {"replace.uncacheOld", false}, {"replace.park", false},
    {"replace.moveNew", false},       {"replace.uncacheNew", true},  {"replace.cacheNew", true},
    {"replace.discardStaging", true}, {"replace.discardFile", true},
};

struct Mode {
    const char* name;
    bool wipe;                    // command 12 (keeps the old directory) rather than 2
    const char* extraFailpoints;  // armed along with the kill
};
constexpr Mode kModes[] = {
    {"replace", false, ""},
    {"wipe", true, ""},
    {"wipe without exchange", true, ",fm.exchange=errno:22"},
};

class ReplaceCrashTest : public test::IpcTest {
  protected:
    void SetUp() override {
        IpcTest::SetUp();
        if (IsSkipped()) return;
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        // Read this process's (empty) failpoints now, so that the variable
        // set for the daemon below is never read here.
        FailpointClearAll();
        PlistValue entitlements{PlistDict{}};
        entitlements.set("com.ostrea.private.TarnKeeper.deleteContainerContent", true);
        entitlements.set("com.ostrea.private.TarnKeeper.allowed", true);
        wiper_ = daemon_->addClient("wiper", "com.crash.wiper", entitlements);
        // Every start here is a later start in the same boot: the first one
        // would throw the transient new containers away before the request.
        ASSERT_EQ(FirstBootMarkerCreate(), 0);
    }
    void TearDown() override {
        if (daemon_) daemon_->kill9();
        (void)FirstBootMarkerRemove();
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
    }

    struct Made {
        Uuid uuid;
        FileURL url;
    };
    // A container written on disk while the daemon is down; it finds it by scanning.
    Made makeContainer(const std::string& identifier, bool transient, const std::string& marker) {
        auto user = TarnUserIdentityCache::defaultUserIdentity();
        Made made{Uuid::generate(),
                  PathJoin(*TarnGlobalConfiguration::sharedInstance()
                                .containerDirectoryURLForUserIdentity(user, kAppData, transient),
                           Uuid::generate().string())};
        fs::create_directories(PathJoin(made.url, "Documents"));
        auto identity = TarnConcreteContainerIdentity::containerIdentityWithUUID(
                            made.uuid, user, identifier, kAppData)
                            .value();
        EXPECT_TRUE(
            TarnMetadata::initWithContainerIdentity(identity, std::nullopt, made.url, std::nullopt)
                ->writeMetadataToDiskWithError()
                .ok());
        std::ofstream(PathJoin(made.url, marker)) << marker;
        return made;
    }

    void startWith(const std::string& failpoints, bool waitReady = true) {
        ::setenv("TARN_FAILPOINTS", failpoints.c_str(), 1);
        daemon_->start(waitReady);
        ::unsetenv("TARN_FAILPOINTS");
    }

    // Waits until the daemon has ended itself (a "kill" failpoint), then reaps it.
    void expectDiesByItself() {
        const std::string stat = "/proc/" + std::to_string(daemon_->pid()) + "/stat";
        bool dead = false;
        for (auto deadline = std::chrono::steady_clock::now() + 20s;
             !dead && std::chrono::steady_clock::now() < deadline;
             std::this_thread::sleep_for(5ms)) {
            std::ifstream in(stat);
            std::string pid, comm, state;
            dead = !(in >> pid >> comm >> state) || state == "Z";
        }
        EXPECT_TRUE(dead) << "recovery went past its failpoint";
        daemon_->kill9();
    }

    size_t replaceFiles() {
        const FileURL dir = root_.at("/private/var/root/Library/TarnKeeper/Replace");
        if (!fs::exists(dir)) return 0;
        return static_cast<size_t>(
            std::distance(fs::directory_iterator(dir), fs::directory_iterator()));
    }

    // The start's clean-up empties staging and death row: every file named
    // `marker` below the root is gone once it has run.
    void expectGoneAfterCleanup(const std::string& marker) {
        auto remaining = [&] {
            std::vector<std::string> found;
            for (const auto& e : fs::recursive_directory_iterator(
                     root_.path(), fs::directory_options::skip_permission_denied))
                if (e.path().filename() == marker) found.push_back(e.path().string());
            return found;
        };
        std::vector<std::string> found = remaining();
        for (auto deadline = std::chrono::steady_clock::now() + 10s;
             !found.empty() && std::chrono::steady_clock::now() < deadline;
             std::this_thread::sleep_for(20ms))
            found = remaining();
        EXPECT_TRUE(found.empty()) << found.front();
    }

    // Path and UUID string of the live container of `identifier` (command 0, no creation).
    std::pair<std::string, std::string> lookUp(const std::string& identifier) {
        const std::string request =
            "{\"Command\": 0, \"ContainerClass\": 2, \"Identifier\": \"" + identifier + "\"}";
        PlistValue reply = send(admin_, request);
        // The sandbox state may still name the place from before the kill:
        // that first answer drops the stale entry.
        if (errorOf(reply) == TarnErrorCacheInconsistent) reply = send(admin_, request);
        EXPECT_EQ(errorOf(reply), TarnSuccess) << identifier;
        const PlistValue* uuid = reply.find("ReplyUUID");
        return {stringOf(reply, "ReplyPath"),
                uuid && uuid->asUuid() ? uuid->asUuid()->string() : std::string()};
    }

    std::string wiper_;
};

TEST_F(ReplaceCrashTest, KilledAtEveryStepNeverLosesTheOldContainer) {
    if (IsSkipped()) return;
    int n = 0;
    for (const Mode& mode : kModes) {
        for (const Step& step : kSteps) {
            SCOPED_TRACE(std::string(mode.name) + ", killed before " + step.failpoint);
            const std::string id = "com.crash.replace" + std::to_string(n++);
            const Made old = makeContainer(id, /*transient=*/false, "old-" + id);
            const Made neu =
                mode.wipe ? Made{} : makeContainer(id, /*transient=*/true, "new-" + id);

            startWith(std::string(step.failpoint) + "=kill" + mode.extraFailpoints);
            const std::string request =
                mode.wipe
                    ? "{\"Command\": 12, \"ContainerClass\": 2, \"Identifier\": \"" + id + "\"}"
                    : "{\"Command\": 2, \"OldIdentifier\": \"" + id +
                          "\", \"OldContainerClass\": 2, \"OldContainerUUID\": {\"$uuid\": \"" +
                          old.uuid.string() + "\"}, \"NewIdentifier\": \"" + id +
                          "\", \"NewContainerClass\": 2, \"NewContainerUUID\": {\"$uuid\": \"" +
                          neu.uuid.string() + "\"}}";
            EXPECT_FALSE(daemon_->send(mode.wipe ? wiper_ : admin_, request))
                << "the daemon answered instead of dying";
            daemon_->kill9();

            // Recovery killed before its restore (when it has one), then before
            // it discards the replace file.
            for (const char* recoveryKill :
                 {"replace.recover.restore=kill,replace.recover.discard=kill",
                  "replace.recover.discard=kill"}) {
                if (replaceFiles() == 0) break;
                startWith(recoveryKill, /*waitReady=*/false);
                expectDiesByItself();
            }
            startWith("");

            EXPECT_EQ(replaceFiles(), 0u);
            const auto [path, uuid] = lookUp(id);
            const FileURL dest = mode.wipe ? old.url
                                           : PathJoin(fs::path(old.url).parent_path().string(),
                                                      PathLastComponent(neu.url));
            if (!step.arrived) {
                EXPECT_EQ(path, old.url);
                EXPECT_EQ(uuid, old.uuid.string());
                EXPECT_TRUE(fs::exists(PathJoin(old.url, "old-" + id)));
                if (!mode.wipe) EXPECT_TRUE(fs::exists(PathJoin(neu.url, "new-" + id)));
            } else {
                EXPECT_EQ(path, dest);
                EXPECT_EQ(uuid, (mode.wipe ? old.uuid : neu.uuid).string());
                if (!mode.wipe) EXPECT_TRUE(fs::exists(PathJoin(dest, "new-" + id)));
                EXPECT_TRUE(fs::is_directory(PathJoin(dest, "Documents")));
                expectGoneAfterCleanup("old-" + id);
            }
            daemon_->kill9();
            if (HasFailure()) return;
        }
    }
}

}  // namespace
}  // namespace tarn
