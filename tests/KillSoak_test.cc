// Kill soak: four clients create, delete, wipe, replace, list and empty death
// row while the daemon is killed with SIGKILL at random moments. After every
// kill the tree the crash left must pass the consistency checker, and after
// the restart every container a reply reported as created is still there and
// every one a reply reported as deleted is still gone.
//
// TARN_SOAK_CYCLES (default 200) sets the number of cycles; TARN_SOAK_SECONDS,
// when set, runs cycles until that many seconds have passed instead
// (scripts/soak HOURS). TARN_SOAK_SEED replays a run.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <map>
#include <mutex>
#include <random>
#include <set>
#include <thread>

#include "Daemon/TarnConsistencyChecker.h"
#include "Daemon/TarnError.h"
#include "support/CrashTest.h"

namespace tarn {
namespace {

constexpr int kClients = 4;
constexpr int kIdentifiersPerClient = 4;

// What the replies said about one identifier.
enum class Known { Nothing, Created, Deleted };

class KillSoakTest : public test::CrashTest {
  protected:
    void SetUp() override {
        CrashTest::SetUp();
        if (IsSkipped()) return;
        useWipingAdmin("soaker", "com.soak.soaker");
    }

    static std::string uuidOf(const std::optional<PlistValue>& reply) {
        const PlistValue* u = reply ? reply->find("ReplyUUID") : nullptr;
        return u && u->asUuid() ? u->asUuid()->string() : std::string();
    }

    static std::string identifier(int client, int i) {
        return "com.soak.c" + std::to_string(client) + "." + std::to_string(i);
    }

    // One client's random requests on its own identifiers until `stop`; the
    // replies update `known` (only this client touches its identifiers, so
    // the order of its replies is the order of the effects).
    void client(int c, unsigned seed, const std::atomic<bool>& stop) {
        std::mt19937 rng(seed);
        while (!stop.load()) {
            const std::string id = identifier(c, static_cast<int>(rng() % kIdentifiersPerClient));
            const std::string ofId = R"("ContainerClass": 2, "Identifier": ")" + id + R"(")";
            const unsigned pick = rng() % 10;
            if (pick < 4) {
                const uint64_t e = errorOf(daemon_->send(
                    admin_, R"({"Command": 0, "CreateIfNecessary": true, )" + ofId + "}"));
                std::lock_guard<std::mutex> lock(mu_);
                if (e == TarnSuccess)
                    known_[id] = Known::Created;
                else if (known_[id] != Known::Created)
                    known_[id] = Known::Nothing;
            } else if (pick < 6) {
                const uint64_t e =
                    errorOf(daemon_->send(admin_, R"({"Command": 10, )" + ofId + "}"));
                std::lock_guard<std::mutex> lock(mu_);
                if (e == TarnSuccess || e == TarnErrorNotFound)
                    known_[id] = Known::Deleted;
                else
                    known_[id] = Known::Nothing;
            } else if (pick < 7) {
                // A wipe keeps the container, whatever its outcome.
                (void)daemon_->send(admin_, R"({"Command": 12, )" + ofId + "}");
            } else if (pick < 8) {
                // A replacement moves a transient container in under the
                // same identifier: live before, live after, whatever happens.
                const std::string old =
                    uuidOf(daemon_->send(admin_, R"({"Command": 0, )" + ofId + "}"));
                const std::string neu = uuidOf(daemon_->send(
                    admin_, R"({"Command": 0, "CreateIfNecessary": true, "Transient": true, )" +
                                ofId + "}"));
                if (!old.empty() && !neu.empty())
                    (void)daemon_->send(
                        admin_,
                        R"({"Command": 2, "OldIdentifier": ")" + id +
                            R"(", "OldContainerClass": 2, "OldContainerUUID": {"$uuid": ")" + old +
                            R"("}, "NewIdentifier": ")" + id +
                            R"(", "NewContainerClass": 2, "NewContainerUUID": {"$uuid": ")" + neu +
                            R"("}})");
            } else if (pick < 9) {
                (void)daemon_->send(admin_, R"({"Command": 4})");
            } else {
                (void)daemon_->send(admin_, R"({"Command": 1, "ContainerClass": 2})");
            }
        }
    }

    // The identifiers the daemon lists as live containers of class 2.
    std::set<std::string> listed() {
        std::set<std::string> ids;
        auto r = daemon_->send(admin_, R"({"Command": 1, "ContainerClass": 2})");
        EXPECT_EQ(errorOf(r), TarnSuccess);
        const PlistValue* array = r ? r->find("ReplyIdsArray") : nullptr;
        if (array && array->asArray())
            for (const PlistValue& v : *array->asArray())
                if (v.asString()) ids.insert(*v.asString());
        return ids;
    }

    std::mutex mu_;
    std::map<std::string, Known> known_;
};

TEST_F(KillSoakTest, NoReportedContainerIsLostAndTheTreeStaysConsistent) {
    const char* seedText = std::getenv("TARN_SOAK_SEED");
    const unsigned seed = seedText ? static_cast<unsigned>(std::strtoul(seedText, nullptr, 10))
                                   : std::random_device{}();
    SCOPED_TRACE("TARN_SOAK_SEED=" + std::to_string(seed));
    std::mt19937 rng(seed);
    const char* cyclesText = std::getenv("TARN_SOAK_CYCLES");
    const char* secondsText = std::getenv("TARN_SOAK_SECONDS");
    const int cycles = cyclesText ? std::atoi(cyclesText) : 200;
    const auto until = std::chrono::steady_clock::now() +
                       std::chrono::seconds(secondsText ? std::atol(secondsText) : 0);

    const auto started = std::chrono::steady_clock::now();
    int cycle = 0;
    size_t violations = 0;
    for (; secondsText ? std::chrono::steady_clock::now() < until : cycle < cycles; ++cycle) {
        SCOPED_TRACE("cycle " + std::to_string(cycle));
        daemon_->start();
        // Every reply reported before this restart still holds.
        const std::set<std::string> live = listed();
        {
            std::lock_guard<std::mutex> lock(mu_);
            for (const auto& [id, state] : known_) {
                if (state == Known::Created) EXPECT_TRUE(live.count(id)) << id << " was lost";
                if (state == Known::Deleted) EXPECT_FALSE(live.count(id)) << id << " came back";
            }
        }
        std::atomic<bool> stop{false};
        std::vector<std::thread> clients;
        for (int c = 0; c < kClients; ++c)
            clients.emplace_back([this, c, &stop, s = rng()] { client(c, s, stop); });
        std::this_thread::sleep_for(std::chrono::milliseconds(20 + rng() % 250));
        daemon_->kill9();
        stop = true;
        for (auto& t : clients) t.join();

        const TarnConsistencyReport report = TarnCheckContainerTree({.orphansAreViolations = true});
        violations += report.violations.size();
        EXPECT_TRUE(report.clean()) << report.describe();
        if (HasFailure()) break;
    }
    const double seconds =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - started).count();
    std::cout << "[ soak     ] " << cycle << " kill cycles in " << seconds << " s, " << violations
              << " violations\n";
}

}  // namespace
}  // namespace tarn
