// Failpoint sweep: every mutating operation is one row of a table. A traced
// run finds the failpoints the operation passes; then, for each of them, the
// operation runs again with "kill" there (the daemon restarts, crashes a
// second time at the same point inside its own recovery when it passes it,
// restarts again) and with ENOSPC, EIO and, for moves, EXDEV. After each case
// the tree must pass the consistency checker (strict: no orphan either) and
// the operation's own effect must be as before or as after, never between:
// a request that failed left nothing, one that succeeded left everything.
#include <gtest/gtest.h>
#include <signal.h>

#include <cstdlib>
#include <fstream>
#include <map>
#include <thread>

#include "Daemon/TarnConsistencyChecker.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnMetadata.h"
#include "Platform/FileSystem.h"
#include "Platform/LockState.h"
#include "support/CrashTest.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
class FailpointSweepTest;

// One mutating operation.
struct SweepRow {
    const char* name;
    // Unarmed preparation for identifier `id`; answers the request under test.
    std::string (*prepare)(FailpointSweepTest& t, const std::string& id);
    // After recovery: the effect is as before or as after. `reply` is the
    // request's "ReplyError", 0 when no reply came (the daemon was killed).
    void (*check)(FailpointSweepTest& t, const std::string& id, uint64_t reply);
};

class FailpointSweepTest : public test::CrashTest, public ::testing::WithParamInterface<SweepRow> {
  public:
    using CrashTest::errorOf;

    void SetUp() override {
        CrashTest::SetUp();
        if (IsSkipped()) return;
        useWipingAdmin("sweeper", "com.sweep.sweeper");
        ASSERT_EQ(LockStateSet(0), 0);
        // Every start is a later start in the same boot: a first one would
        // throw away the transient containers a replacement brings in.
        // The boot sweeps have their own test, which reboots.
        ASSERT_EQ(FirstBootMarkerCreate(), 0);
    }

    std::optional<PlistValue> send(const std::string& json) { return daemon_->send(admin_, json); }
    uint64_t ask(const std::string& json) { return daemon_->sendError(admin_, json); }
    static std::string stringOf(const std::optional<PlistValue>& r, const char* key) {
        const PlistValue* v = r ? r->find(key) : nullptr;
        return v && v->asString() ? *v->asString() : std::string();
    }

    static std::string container(const std::string& id, bool create) {
        return R"({"Command": 0, "ContainerClass": 2, "Identifier": ")" + id +
               R"(", "CreateIfNecessary": )" + (create ? "true" : "false") + "}";
    }
    // The container's reply without creating it; a stale sandbox answer
    // (TarnErrorCacheInconsistent) drops the entry and is asked again.
    std::optional<PlistValue> lookup(const std::string& id) {
        auto r = send(container(id, false));
        if (errorOf(r) == TarnErrorCacheInconsistent) r = send(container(id, false));
        return r;
    }
    std::string concrete(const std::string& id) {
        auto r = send(container(id, true));
        EXPECT_EQ(errorOf(r), TarnSuccess) << id;
        const PlistValue* uuid = r ? r->find("ReplyUUID") : nullptr;
        std::string text = uuid && uuid->asUuid() ? uuid->asUuid()->string() : "";
        return R"("Identifier": ")" + id + R"(", "ContainerClass": 2, "UUID": {"$uuid": ")" + text +
               R"("})";
    }

    // The daemon restarts after a kill; when `recoveryCrash` names a
    // failpoint, the first restart dies there if its recovery passes it.
    void restartAfterKill(const std::string& recoveryCrash) {
        ::setenv("TARN_FAILPOINTS", (recoveryCrash + "=kill").c_str(), 1);
        daemon_->start(/*waitReady=*/false);
        ::unsetenv("TARN_FAILPOINTS");
        // Either start-up dies at the failpoint or it finishes; a finished one
        // still has the failpoint armed, so it goes too.
        const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
        while (std::chrono::steady_clock::now() < deadline) {
            if (daemon_->waitExit(std::chrono::milliseconds(20))) {
                ++recoveryCrashes_;
                break;
            }
            if (daemon_->waitForNotification("com.ostrea.tarnkeeper.cleanup-complete",
                                             std::chrono::milliseconds(20),
                                             /*sinceLastStart=*/true))
                break;
        }
        daemon_->kill9();
        daemon_->start();
    }

    // Stops the daemon and runs the checker on the tree it left.
    void stopAndVerify(const std::string& what) {
        daemon_->stop();
        const TarnConsistencyReport report = TarnCheckContainerTree({.orphansAreViolations = true});
        EXPECT_TRUE(report.clean()) << what << "\n" << report.describe();
        violations_ += report.violations.size();
    }

    // The failpoints the request of `row` passes, with their hit counts.
    std::map<std::string, int> trace(const SweepRow& row) {
        const std::string file = root_.at("/failpoint.trace");
        startArmed("", file);
        const std::string request = row.prepare(*this, "com.sweep.traced");
        daemon_->signal(SIGUSR2);
        const uint64_t reply = ask(request);
        EXPECT_EQ(reply, TarnSuccess) << row.name << " fails even without a failpoint";
        stopAndVerify(std::string(row.name) + " without a failpoint");
        std::map<std::string, int> hits;
        std::ifstream in(file);
        for (std::string line; std::getline(in, line);) ++hits[line];
        return hits;
    }

    void sweep(const SweepRow& row) {
        const std::map<std::string, int> hits = trace(row);
        ASSERT_FALSE(hits.empty()) << row.name << " passes no failpoint";
        int n = 0;
        for (const auto& [name, count] : hits) {
            std::vector<std::string> actions = {"kill@1", "errno:28@1", "errno:5@1"};
            if (count > 1) actions.push_back("kill@" + std::to_string(count));
            if (name.starts_with("fm.move")) actions.push_back("errno:18@1");
            for (const std::string& action : actions) {
                const std::string id = "com.sweep.case" + std::to_string(n++);
                SCOPED_TRACE(std::string(row.name) + " with " + name + "=" + action);
                startArmed(name + "=" + action);
                const std::string request = row.prepare(*this, id);
                daemon_->signal(SIGUSR2);
                std::optional<PlistValue> reply = send(request);
                const bool killed = action.starts_with("kill");
                if (killed) {
                    // The traced hit may have come from background work that
                    // this run did not do (yet): then the case is a plain kill.
                    if (!daemon_->waitExit(std::chrono::seconds(2))) {
                        daemon_->kill9();
                        ++notReached_;
                    }
                    restartAfterKill(name);
                }
                row.check(*this, id, killed ? 0 : errorOf(reply));
                stopAndVerify(name + "=" + action);
                ++cases_;
                if (HasFailure()) return;
            }
        }
        std::cout << "[ sweep    ] " << row.name << ": " << hits.size() << " failpoints, " << cases_
                  << " cases (" << notReached_ << " kills not reached), " << recoveryCrashes_
                  << " crashes inside recovery, " << violations_ << " violations\n";
    }

    // Path and UUID of the live container of `id` ("" when there is none).
    std::pair<std::string, std::string> placeOf(const std::string& id) {
        auto r = lookup(id);
        const PlistValue* uuid = r ? r->find("ReplyUUID") : nullptr;
        return {stringOf(r, "ReplyPath"),
                uuid && uuid->asUuid() ? uuid->asUuid()->string() : std::string()};
    }
    std::string make(const std::string& id, bool transient, const std::string& marker) {
        auto r =
            send(R"({"Command": 0, "ContainerClass": 2, "CreateIfNecessary": true, )"
                 R"("Transient": )" +
                 std::string(transient ? "true" : "false") + R"(, "Identifier": ")" + id + R"("})");
        EXPECT_EQ(errorOf(r), TarnSuccess) << id;
        const PlistValue* uuid = r ? r->find("ReplyUUID") : nullptr;
        std::ofstream(stringOf(r, "ReplyPath") + "/Documents/" + marker) << marker;
        return uuid && uuid->asUuid() ? uuid->asUuid()->string() : std::string();
    }
    // Whether `dir` holds no record file (an interrupted atomic write may
    // leave its hidden temporary file, which nothing reads).
    bool emptyDirectory(const char* dir) {
        std::error_code ec;
        for (const auto& e : fs::directory_iterator(root_.at(dir), ec))
            if (e.path().filename().string()[0] != '.') return false;
        return true;
    }
    // After a failed replacement the next start finishes what is left: a
    // replace file the clean-up could not discard, and a cache that lacks
    // the container which arrived when a cache change after its arrival
    // failed (the cache is rebuilt from disk).
    void settleReplacement(uint64_t reply) {
        if (reply == TarnErrorCacheAddFailed || reply == TarnErrorCacheRemoveFailed ||
            !emptyDirectory("/private/var/root/Library/TarnKeeper/Replace"))
            restart();
    }
    void restart() {
        daemon_->stop();
        daemon_->start();
    }

    // What the replacement of the current case started from.
    std::string oldUuid_, newUuid_;

    int cases_ = 0;
    int recoveryCrashes_ = 0;
    int notReached_ = 0;
    size_t violations_ = 0;
};

// ---- the rows ----

void checkCreated(FailpointSweepTest& t, const std::string& id, uint64_t reply) {
    const uint64_t found = FailpointSweepTest::errorOf(t.lookup(id));
    if (reply == TarnSuccess)
        EXPECT_EQ(found, TarnSuccess) << "reported created, then lost";
    else if (reply != 0)
        EXPECT_EQ(found, TarnErrorNotFound) << "failed creation left a container";
    else
        EXPECT_TRUE(found == TarnSuccess || found == TarnErrorNotFound) << found;
    // A later request of the same container works and is recorded again.
    EXPECT_EQ(t.ask(FailpointSweepTest::container(id, true)), TarnSuccess);
}

void checkGone(FailpointSweepTest& t, const std::string& id, uint64_t reply) {
    const uint64_t found = FailpointSweepTest::errorOf(t.lookup(id));
    if (reply == TarnSuccess)
        EXPECT_EQ(found, TarnErrorNotFound) << "reported deleted, still there";
    else if (reply != 0)
        EXPECT_EQ(found, TarnSuccess) << "failed deletion lost the container";
    else
        EXPECT_TRUE(found == TarnSuccess || found == TarnErrorNotFound) << found;
}

void checkTreeOnly(FailpointSweepTest& t, const std::string& id, uint64_t) {
    // The daemon still serves the identifier.
    EXPECT_EQ(t.ask(FailpointSweepTest::container(id, true)), TarnSuccess);
}

void checkInfo(FailpointSweepTest& t, const std::string& id, uint64_t reply) {
    auto read = t.send(R"({"Command": 6, "Key": "Colour", )" + t.concrete(id) + "}");
    const PlistValue* v = read ? read->find("ReplyInfoValue") : nullptr;
    const bool written = v && v->asString() && *v->asString() == "teal";
    if (reply == TarnSuccess)
        EXPECT_TRUE(written) << "reported written, then lost";
    else if (reply != 0)
        EXPECT_FALSE(written) << "failed write took effect";
}

void checkCodeSigning(FailpointSweepTest& t, const std::string& id, uint64_t reply) {
    // A store that fails inside the mapping's batch is logged and the request
    // still succeeds (later pairs of the batch are written all the same), so
    // only a failed reply says something: then nothing was recorded.
    const uint64_t read = t.ask(R"({"Command": 19, "Identifier": ")" + id + R"("})");
    if (reply != 0 && reply != TarnSuccess)
        EXPECT_NE(read, TarnSuccess) << "failed record took effect";
}

// A replacement or wipe whose clean-up fails after the new container has
// arrived answers with that error although the swap is done, so a failed
// reply allows either state; only a successful one pins it.
void checkReplaced(FailpointSweepTest& t, const std::string& id, uint64_t reply) {
    t.settleReplacement(reply);
    EXPECT_TRUE(t.emptyDirectory("/private/var/root/Library/TarnKeeper/Replace"))
        << "recovery left a replace file";
    const auto [path, uuid] = t.placeOf(id);
    const bool arrived = uuid == t.newUuid_;
    if (reply == TarnSuccess) EXPECT_TRUE(arrived) << "reported replaced, old container still live";
    EXPECT_TRUE(arrived || uuid == t.oldUuid_) << "neither container is live: " << uuid;
    // Whichever is live has its own contents.
    EXPECT_TRUE(fs::exists(path + "/Documents/" + (arrived ? "new" : "old"))) << path;
    // A later request finds it rather than making a twin.
    EXPECT_EQ(t.placeOf(id).first, path);
    EXPECT_EQ(t.ask(FailpointSweepTest::container(id, true)), TarnSuccess);
}

void checkWiped(FailpointSweepTest& t, const std::string& id, uint64_t reply) {
    t.settleReplacement(reply);
    EXPECT_TRUE(t.emptyDirectory("/private/var/root/Library/TarnKeeper/Replace"))
        << "recovery left a replace file";
    const auto [path, uuid] = t.placeOf(id);
    EXPECT_EQ(uuid, t.oldUuid_) << "a wipe keeps the container";
    EXPECT_TRUE(fs::is_directory(path + "/Documents")) << path;
    if (reply == TarnSuccess)
        EXPECT_FALSE(fs::exists(path + "/Documents/old")) << "reported wiped, contents still there";
}

int32_t protectionClassOf(const std::string& path) {
    FsFd fd;
    int32_t cls = -1;
    if (FsOpenItem(-1, path, &fd) == 0) (void)FsGetProtectionClass(fd.get(), &cls);
    return cls;
}

void checkProtected(FailpointSweepTest& t, const std::string& id, uint64_t reply) {
    // A change left pending runs again at start-up and then removes its file.
    // A failed write may leave a complete one behind (the failure came after
    // its rename): the next start then makes the change after all.
    const char* pending = "/private/var/root/Library/TarnKeeper/PendingUpdates";
    auto drained = [&](std::chrono::seconds limit) {
        for (auto deadline = std::chrono::steady_clock::now() + limit;
             !t.emptyDirectory(pending) && std::chrono::steady_clock::now() < deadline;)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        return t.emptyDirectory(pending);
    };
    if (reply != 0 && !drained(std::chrono::seconds(1))) t.restart();
    EXPECT_TRUE(drained(std::chrono::seconds(10))) << "a pending change never finished";
    auto read =
        t.send(R"({"Command": 6, "Key": ")" + std::string(kTarnInfoContentProtectionClassKey) +
               R"(", )" + t.concrete(id) + "}");
    const PlistValue* v = read ? read->find("ReplyInfoValue") : nullptr;
    const int64_t recorded = v ? v->asInt64().value_or(-1) : -1;
    const std::string documents = t.placeOf(id).first + "/Documents";
    // Recording the class in the info is best effort: a failure there is
    // only logged, so a success may have left no record, but never another one.
    if (reply == TarnSuccess) {
        EXPECT_TRUE(recorded == 1 || recorded == -1) << recorded;
        EXPECT_EQ(protectionClassOf(documents), 1) << "reported changed, not applied";
    } else if (recorded == 1) {
        EXPECT_EQ(protectionClassOf(documents), 1) << "recorded, not applied";
    }
}

const SweepRow kRows[] = {
    {"create",
     [](FailpointSweepTest&, const std::string& id) {
         return FailpointSweepTest::container(id, true);
     },
     checkCreated},
    {"delete",
     [](FailpointSweepTest& t, const std::string& id) {
         EXPECT_EQ(t.ask(FailpointSweepTest::container(id, true)), TarnSuccess);
         return R"({"Command": 10, "ContainerClass": 2, "Identifier": ")" + id + R"("})";
     },
     checkGone},
    {"stage_for_deletion",
     [](FailpointSweepTest& t, const std::string& id) {
         auto made = t.send(FailpointSweepTest::container(id, true));
         const PlistValue* uuid = made ? made->find("ReplyUUID") : nullptr;
         const std::string u = uuid && uuid->asUuid() ? uuid->asUuid()->string() : "";
         return R"({"Command": 3, "ContainerClassesArray": [2], "UUIDsArray": [{"$uuid": ")" + u +
                R"("}], "IdentifiersArray": [")" + id + R"("], "PersonaUniqueStringsArray": [""]})";
     },
     checkGone},
    {"death_row_pass",
     [](FailpointSweepTest& t, const std::string& id) {
         EXPECT_EQ(t.ask(FailpointSweepTest::container(id, true)), TarnSuccess);
         EXPECT_EQ(t.ask(R"({"Command": 10, "ContainerClass": 2, "Identifier": ")" + id + R"("})"),
                   TarnSuccess);
         return std::string(R"({"Command": 4})");
     },
     checkTreeOnly},
    {"info_write",
     [](FailpointSweepTest& t, const std::string& id) {
         return R"({"Command": 5, "Key": "Colour", "Value": "teal", )" + t.concrete(id) + "}";
     },
     checkInfo},
    {"code_signing_write",
     [](FailpointSweepTest&, const std::string& id) {
         return R"({"Command": 18, "Identifier": ")" + id +
                R"(", "CodeSigningInfo": {"com.ostrea.TarnKeeper.Entitlements": {}}, )"
                R"("OptionsDictionary": {}})";
     },
     checkCodeSigning},
    {"replace",
     [](FailpointSweepTest& t, const std::string& id) {
         t.oldUuid_ = t.make(id, /*transient=*/false, "old");
         t.newUuid_ = t.make(id, /*transient=*/true, "new");
         return R"({"Command": 2, "OldIdentifier": ")" + id +
                R"(", "OldContainerClass": 2, "OldContainerUUID": {"$uuid": ")" + t.oldUuid_ +
                R"("}, "NewIdentifier": ")" + id +
                R"(", "NewContainerClass": 2, "NewContainerUUID": {"$uuid": ")" + t.newUuid_ +
                R"("}})";
     },
     checkReplaced},
    {"wipe",
     [](FailpointSweepTest& t, const std::string& id) {
         t.oldUuid_ = t.make(id, /*transient=*/false, "old");
         return R"({"Command": 12, "ContainerClass": 2, "Identifier": ")" + id + R"("})";
     },
     checkWiped},
    {"data_protection_change",
     [](FailpointSweepTest& t, const std::string& id) {
         t.make(id, /*transient=*/false, "file");
         return R"({"Command": 21, "ContainerClass": 2, "Identifier": ")" + id +
                R"(", "DataProtectionClass": 1, "IsThirdParty": false, "RetryIfLocked": false})";
     },
     checkProtected},
};

TEST_P(FailpointSweepTest, TreeIsAsBeforeOrAsAfter) { sweep(GetParam()); }

INSTANTIATE_TEST_SUITE_P(Operations, FailpointSweepTest, ::testing::ValuesIn(kRows),
                         [](const auto& info) { return std::string(info.param.name); });

}  // namespace
}  // namespace tarn
