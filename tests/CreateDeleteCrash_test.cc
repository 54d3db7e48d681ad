// Crash safety of creation and deletion: clients create, delete and empty
// death row while the daemon is killed with SIGKILL at random moments. After
// every restart each live container directory must hold valid metadata, no
// identifier may have two live containers, and lookups must agree with the
// disk. Slowed file moves and directory creations widen the windows in which
// a container is half built.
#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <random>
#include <thread>

#include "Daemon/TarnError.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Tools/tarnctl/Json.h"
#include "support/CrashTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

constexpr int kRounds = 5;
constexpr int kIdentifiers = 6;
constexpr int kWorkers = 3;

class CreateDeleteCrashTest : public test::CrashTest {
  protected:
    void startSlowed() {
        ::setenv("TARN_FAILPOINTS", "fm.move=sleep:15,fm.createDirectory=sleep:2", 1);
        daemon_->start();
        ::unsetenv("TARN_FAILPOINTS");
    }

    // The reply of one request; empty when the daemon went away meanwhile.
    std::optional<PlistValue> send(const std::string& json) {
        test::ProcessResult r = daemon_->tarnctl(admin_, {"send", json});
        if (r.exitCode != 0) return std::nullopt;
        std::string why;
        return tarnctl::JsonToPlist(r.out, &why);
    }
    static std::string pathOf(const std::optional<PlistValue>& reply) {
        const PlistValue* p = reply ? reply->find("ReplyPath") : nullptr;
        return p && p->asString() ? *p->asString() : std::string();
    }
    static std::string containerRequest(const std::string& identifier, bool create,
                                        bool transient) {
        return std::string(R"({"Command": 0, "ContainerClass": 2, "Identifier": ")") + identifier +
               R"(", "CreateIfNecessary": )" + (create ? "true" : "false") + R"(, "Transient": )" +
               (transient ? "true" : "false") + "}";
    }
    static std::string identifierNumber(int i) { return "com.crash.app" + std::to_string(i); }

    // One client's random stream of creations and deletions until `stop`.
    void work(unsigned seed, const std::atomic<bool>& stop) {
        std::mt19937 rng(seed);
        while (!stop.load()) {
            const std::string id = identifierNumber(static_cast<int>(rng() % kIdentifiers));
            switch (rng() % 6) {
                case 0:
                case 1:
                case 2:
                    (void)send(containerRequest(id, true, false));
                    break;
                case 3:
                    (void)send(containerRequest(id, true, true));
                    break;
                case 4:
                    (void)send(R"({"Command": 10, "ContainerClass": 2, "Identifier": ")" + id +
                               R"("})");
                    break;
                default:
                    (void)send(R"({"Command": 4})");
                    break;
            }
        }
    }

    // Every live directory of `parent` is a whole container of ours; returns
    // identifier -> path, failing on an identifier that is live twice.
    std::map<std::string, std::string> checkLiveDirectory(const FileURL& parent) {
        std::map<std::string, std::string> live;
        if (!fs::exists(parent)) return live;
        for (const auto& entry : fs::directory_iterator(parent)) {
            const std::string path = entry.path().string();
            EXPECT_TRUE(entry.is_directory()) << path;
            auto read = TarnMetadata::readAndValidateMetadataAtUrl(
                path, TarnUserIdentityCache::defaultUserIdentity(), false);
            EXPECT_TRUE(read.ok()) << "half-built container at " << path << ": "
                                   << (read.error() ? read.error()->description() : "");
            if (!read.ok()) continue;
            const TarnMetadataRef metadata = *read;
            EXPECT_EQ(metadata->containerClass(), 2u) << path;
            EXPECT_TRUE(live.emplace(metadata->identifier(), path).second)
                << metadata->identifier() << " is live twice: " << path;
        }
        return live;
    }

    // The daemon's answers agree with the disk and it still creates containers.
    void checkLookups(const FileURL& liveParent) {
        std::map<std::string, std::string> live = checkLiveDirectory(liveParent);
        for (int i = 0; i < kIdentifiers; ++i) {
            const std::string id = identifierNumber(i);
            auto found = send(containerRequest(id, false, false));
            // The sandbox state may still name a container staged just before
            // the kill: that first answer is TarnErrorCacheInconsistent and
            // drops the stale entry.
            if (errorOf(found) == TarnErrorCacheInconsistent)
                found = send(containerRequest(id, false, false));
            auto it = live.find(id);
            if (it == live.end()) {
                EXPECT_EQ(errorOf(found), TarnErrorNotFound) << id;
            } else {
                EXPECT_EQ(errorOf(found), TarnSuccess) << id;
                EXPECT_EQ(pathOf(found), it->second) << id;
            }
            auto made = send(containerRequest(id, true, false));
            EXPECT_EQ(errorOf(made), TarnSuccess) << id;
            EXPECT_TRUE(fs::is_directory(pathOf(made))) << id;
        }
    }
};

TEST_F(CreateDeleteCrashTest, KilledDaemonNeverLeavesAHalfBuiltContainerLive) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 rng(seed);

    startSlowed();
    // Where permanent and transient containers of the class live.
    const FileURL liveParent =
        fs::path(pathOf(send(containerRequest("com.crash.probe", true, false)))).parent_path();
    const FileURL transientParent =
        fs::path(pathOf(send(containerRequest("com.crash.probe", true, true)))).parent_path();
    ASSERT_FALSE(liveParent.empty());
    ASSERT_FALSE(transientParent.empty());

    for (int round = 0; round < kRounds; ++round) {
        SCOPED_TRACE("round " + std::to_string(round));
        std::atomic<bool> stop{false};
        std::vector<std::thread> workers;
        for (int w = 0; w < kWorkers; ++w)
            workers.emplace_back([this, &stop, s = rng()] { work(s, stop); });
        std::this_thread::sleep_for(std::chrono::milliseconds(100 + rng() % 500));
        daemon_->kill9();
        stop = true;
        for (auto& t : workers) t.join();

        startSlowed();
        checkLookups(liveParent);
        (void)checkLiveDirectory(transientParent);
        if (HasFailure()) break;
    }
}

}  // namespace
}  // namespace tarn
