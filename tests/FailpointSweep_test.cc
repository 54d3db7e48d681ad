// Failpoint sweep: every mutating operation is one row of a table. A traced
// run finds the failpoints the operation passes; then, for each of them, the
// operation runs again with "kill" there (the daemon restarts, crashes a
// second time at the same point inside its own recovery when it passes it,
// restarts again) and with ENOSPC, EIO and, for moves, EXDEV. After each case
// the tree must pass the consistency checker (strict: no orphan either) and
// the operation's own effect must be as before or as after, never between:
// a request that failed left nothing, one that succeeded left everything.
// The start-up sweeps of leftovers are rows of their own (see below).
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

constexpr const char* kCaches = "/private/var/root/Library/Caches/com.ostrea.tarnkeeperd";

// One mutating operation.
struct SweepRow {
    const char* name;
    // Unarmed preparation for identifier `id`; answers the request under test.
    std::string (*prepare)(FailpointSweepTest& t, const std::string& id);
    // After recovery: the effect is as before or as after. `reply` is the
    // request's "ReplyError", 0 when no reply came (the daemon was killed).
    void (*check)(FailpointSweepTest& t, const std::string& id, uint64_t reply);
};

// What the request rows and the start rows share: the daemon, its client,
// the restart after a kill, the checker and the figures.
class SweepHarness : public test::CrashTest {
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

    // Starts with `failpoints` armed from start-up on, without a gate; with
    // `trace`, records the hits. Returns once the daemon has died or
    // start-up's clean-up has been announced; true when it died.
    bool startWith(const std::string& failpoints, const std::string& trace = "") {
        ::setenv("TARN_FAILPOINTS", failpoints.c_str(), 1);
        if (!trace.empty()) ::setenv("TARN_FAILPOINTS_TRACE", trace.c_str(), 1);
        daemon_->start(/*waitReady=*/false);
        ::unsetenv("TARN_FAILPOINTS");
        ::unsetenv("TARN_FAILPOINTS_TRACE");
        const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
        while (std::chrono::steady_clock::now() < deadline) {
            if (daemon_->waitExit(std::chrono::milliseconds(20))) return true;
            if (daemon_->waitForNotification("com.ostrea.tarnkeeper.cleanup-complete",
                                             std::chrono::milliseconds(20),
                                             /*sinceLastStart=*/true))
                return false;
        }
        ADD_FAILURE() << "start-up neither died nor finished";
        return false;
    }

    // The daemon restarts after a kill; the first restart dies at
    // `recoveryCrash` ("name=kill" or "name=kill@N") if its recovery gets
    // there. A restart that finished still has the failpoint armed, so it goes too.
    void restartAfterKill(const std::string& recoveryCrash) {
        if (startWith(recoveryCrash)) ++recoveryCrashes_;
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

    // The actions a case list runs at a failpoint whose hits of interest are
    // `first` to `last`: a kill at both ends, ENOSPC, EIO and, for moves, EXDEV.
    static std::vector<std::string> actionsFor(const std::string& name, int first, int last) {
        const std::string at = "@" + std::to_string(first);
        std::vector<std::string> actions = {"kill" + at, "errno:28" + at, "errno:5" + at};
        if (last > first) actions.push_back("kill@" + std::to_string(last));
        if (name.starts_with("fm.move")) actions.push_back("errno:18" + at);
        return actions;
    }
    void report(const char* row, size_t failpoints) {
        std::cout << "[ sweep    ] " << row << ": " << failpoints << " failpoints, " << cases_
                  << " cases (" << notReached_ << " kills not reached), " << recoveryCrashes_
                  << " crashes inside recovery, " << violations_ << " violations\n";
    }

    int cases_ = 0;
    int recoveryCrashes_ = 0;
    int notReached_ = 0;
    size_t violations_ = 0;
};

class FailpointSweepTest : public SweepHarness, public ::testing::WithParamInterface<SweepRow> {
  public:
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
            for (const std::string& action : actionsFor(name, 1, count)) {
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
                    restartAfterKill(name + "=kill");
                }
                row.check(*this, id, killed ? 0 : errorOf(reply));
                stopAndVerify(name + "=" + action);
                ++cases_;
                if (HasFailure()) return;
            }
        }
        report(row.name, hits.size());
    }

    // What the replacement of the current case started from.
    std::string oldUuid_, newUuid_;
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

// ---- the start rows ----
//
// The boot sweeps are work of a start rather than of a request, so their
// failpoints are armed from the start without a gate and "@N" counts from
// start-up. The hits a start makes without leftovers are start-up's own; the
// sweep takes the ones the leftovers add, which come after them (the sweeps
// run on the background queue once start-up has finished).

struct BootSweepRow {
    const char* name;
    // The first start after a boot, which also sweeps orphans and transient data.
    bool afterBoot;
};

// A leftover directory and the two files that mark it, one at its top and
// one below, so that a half-removed leftover shows.
struct Leftover {
    std::string dir;
    std::string files[2];
};

class BootSweepTest : public SweepHarness, public ::testing::WithParamInterface<BootSweepRow> {
  public:
    static constexpr const char* kMark = "tarn-sweep-leftover";

    std::vector<Leftover> leftovers(const BootSweepRow& row) const {
        std::vector<std::string> dirs = {std::string(kCaches) + "/Staging/half-built",
                                         "/private/var/mobile/Containers/Staging/half-built"};
        if (row.afterBoot) {
            dirs.push_back(
                "/private/var/mobile/Containers/Data/Application/"
                "0A0B0C0D-1111-4222-8333-444455556666");
            dirs.push_back(std::string(kCaches) + "/Temp/leftover");
            dirs.push_back("/private/var/mobile/Containers/Temp/leftover");
        }
        std::vector<Leftover> out;
        for (size_t i = 0; i < dirs.size(); ++i)
            out.push_back({dirs[i],
                           {dirs[i] + "/" + kMark + std::to_string(i) + "a",
                            dirs[i] + "/Library/" + kMark + std::to_string(i) + "b"}});
        return out;
    }
    static bool inStaging(const std::string& path) {
        return path.find("/Staging/") != std::string::npos;
    }

    // Plants the leftovers of `row` in a stopped daemon's tree and, for the
    // first start after a boot, forgets the boot.
    void plant(const BootSweepRow& row) {
        for (const Leftover& l : leftovers(row))
            for (const std::string& file : l.files) root_.writeFile(file, "x");
        if (row.afterBoot) forgetBoot();
    }
    void forgetBoot() {
        ASSERT_EQ(FirstBootMarkerRemove(), 0);
        std::error_code ec;
        fs::remove_all(root_.at("/run"), ec);
        ASSERT_FALSE(ec) << ec.message();
    }

    // The hits of one start of `row`, with or without its leftovers; the
    // requests of the checks that follow do not count.
    std::map<std::string, int> traceStart(const BootSweepRow& row, bool withLeftovers) {
        const std::string file = root_.at("/failpoint.trace");
        fs::remove(file);
        if (withLeftovers)
            plant(row);
        else if (row.afterBoot)
            forgetBoot();
        EXPECT_FALSE(startWith("", file)) << row.name << " died without a failpoint";
        std::map<std::string, int> hits;
        std::ifstream in(file);
        for (std::string line; std::getline(in, line);) ++hits[line];
        if (withLeftovers) checkAfter(row);
        stopAndVerify(std::string(row.name) + " without a failpoint");
        return hits;
    }

    // Live containers the sweeps must leave alone: identifier -> class.
    const std::map<std::string, int> kLive = {{"com.sweep.live", 2}, {"com.sweep.plugin", 4}};
    std::string liveRequest(const std::string& id, int cls) const {
        return R"({"Command": 0, "CreateIfNecessary": true, "ContainerClass": )" +
               std::to_string(cls) + R"(, "Identifier": ")" + id + R"("})";
    }
    void makeLive(const BootSweepRow& row) {
        daemon_->start();
        for (const auto& [id, cls] : kLive) {
            auto r = send(liveRequest(id, cls));
            ASSERT_EQ(errorOf(r), TarnSuccess) << id;
            livePaths_[id] = stringOf(r, "ReplyPath");
            std::ofstream(livePaths_[id] + "/" + kMark + "-live") << "live";
        }
        stopAndVerify("live containers");
        // The first boot of a tree does one-off work (the build record) that
        // would blur which hits the leftovers add.
        if (row.afterBoot) {
            forgetBoot();
            daemon_->start();
            stopAndVerify("first boot");
        }
    }

    // With a cleanly started daemon: the live containers are as they were and
    // every leftover is whole where it was or gone, nowhere in between.
    void checkAfter(const BootSweepRow& row) {
        for (const auto& [id, cls] : kLive) {
            auto r = send(liveRequest(id, cls));
            EXPECT_EQ(stringOf(r, "ReplyPath"), livePaths_[id]) << id << " moved or was made anew";
            EXPECT_TRUE(fs::exists(livePaths_[id] + "/" + kMark + "-live"))
                << id << " lost content";
        }
        std::map<std::string, std::string> original;
        for (const Leftover& l : leftovers(row)) {
            for (const std::string& file : l.files)
                original[fs::path(file).filename()] = root_.at(file);
            EXPECT_EQ(fs::exists(root_.at(l.files[0])), fs::exists(root_.at(l.files[1])))
                << l.dir << " is half there";
        }
        std::error_code ec;
        for (auto it = fs::recursive_directory_iterator(root_.path(), ec);
             !ec && it != fs::recursive_directory_iterator(); it.increment(ec)) {
            const std::string name = it->path().filename();
            if (!name.starts_with(kMark) || name.ends_with("-live")) continue;
            // What a deletion pass can neither remove nor leave goes to /tmp.
            if (it->path().string().starts_with(root_.at("/tmp/"))) continue;
            EXPECT_EQ(it->path().string(), original[name]) << "a leftover half-moved";
            // A clean start empties staging whatever the case left there.
            EXPECT_FALSE(inStaging(it->path().string())) << "a clean start kept " << it->path();
        }
        const std::string deathRow = root_.at(std::string(kCaches) + "/Dead");
        EXPECT_TRUE(!fs::exists(deathRow) || fs::is_empty(deathRow)) << "death row kept something";
    }

    void sweepStarts(const BootSweepRow& row) {
        makeLive(row);
        const std::map<std::string, int> before = traceStart(row, /*withLeftovers=*/false);
        const std::map<std::string, int> hits = traceStart(row, /*withLeftovers=*/true);
        size_t failpoints = 0;
        for (const auto& [name, count] : hits) {
            const int first = (before.contains(name) ? before.at(name) : 0) + 1;
            if (count < first) continue;  // start-up's own
            ++failpoints;
            // A start is cheap: every hit the leftovers add gets its cases.
            for (int hit = first; hit <= count; ++hit) {
                for (const std::string& action : actionsFor(name, hit, hit)) {
                    runCase(row, name + "=" + action);
                    if (HasFailure()) return;
                }
            }
        }
        ASSERT_GT(failpoints, 0u) << row.name << " passes no failpoint";
        report(row.name, failpoints);
    }
    void runCase(const BootSweepRow& row, const std::string& failpoint) {
        SCOPED_TRACE(std::string(row.name) + " with " + failpoint);
        plant(row);
        const bool died = startWith(failpoint);
        if (failpoint.find("=kill") != std::string::npos) {
            if (!died) {
                daemon_->kill9();
                ++notReached_;
            }
            // The next start redoes the sweep and dies at the same hit.
            restartAfterKill(failpoint);
        } else {
            EXPECT_FALSE(died) << "a failed sweep step stopped the daemon";
            restart();
        }
        checkAfter(row);
        // What a failure left outside staging the next boot takes.
        if (row.afterBoot && !settled(row)) {
            daemon_->stop();
            forgetBoot();
            daemon_->start();
            EXPECT_TRUE(settled(row)) << "the next boot left a leftover";
        }
        stopAndVerify(failpoint);
        ++cases_;
    }
    bool settled(const BootSweepRow& row) {
        for (const Leftover& l : leftovers(row))
            if (fs::exists(root_.at(l.dir))) return false;
        return true;
    }

    std::map<std::string, std::string> livePaths_;
};

const BootSweepRow kStartRows[] = {
    {"staging_sweep", /*afterBoot=*/false},
    {"orphan_and_transient_sweeps", /*afterBoot=*/true},
};

TEST_P(BootSweepTest, LeftoversAreWholeOrGoneAndLiveContainersStay) { sweepStarts(GetParam()); }

INSTANTIATE_TEST_SUITE_P(Starts, BootSweepTest, ::testing::ValuesIn(kStartRows),
                         [](const auto& info) { return std::string(info.param.name); });

}  // namespace
}  // namespace tarn
