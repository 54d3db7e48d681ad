// The code-signing store: statements, transactions, error codes, the on-disk
// schema as another SQLite client sees it, and survival of a killed writer.
#include "Daemon/TarnSQLiteDB.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <stdexcept>
#include <thread>

#include "Daemon/TarnGlobalConfiguration.h"
#include "Platform/PlatformLog.h"
#include "support/ScratchRoot.h"

extern char** environ;

namespace tarn {
namespace {

TarnCodeSigningEntryRef makeEntry(const std::string& tag, std::vector<std::string> children = {},
                                  uint64_t dataClass = 2) {
    PlistDict entitlements{{"com.ostrea.security.application-groups", PlistArray{"group." + tag}}};
    auto entry = std::make_shared<TarnCodeSigningEntry>(
        PlistDict{{kTarnEntitlementsKey, entitlements}, {"Tag", tag}}, dataClass);
    entry->setChildBundleIdentifiers(std::move(children));
    return entry;
}

// Runs one SQL query on the store's own connection and answers the first column
// of the first row as an integer.
int64_t queryInt(sqlite3* db, const std::string& sql) {
    sqlite3_stmt* st = nullptr;
    EXPECT_EQ(sqlite3_prepare_v2(db, sql.c_str(), -1, &st, nullptr), SQLITE_OK) << sql;
    int64_t v = -1;
    if (sqlite3_step(st) == SQLITE_ROW) v = sqlite3_column_int64(st, 0);
    sqlite3_finalize(st);
    return v;
}

std::string runCommand(const std::string& command) {
    std::string out;
    FILE* p = ::popen(command.c_str(), "r");
    if (!p) return out;
    char buf[4096];
    size_t n;
    while ((n = std::fread(buf, 1, sizeof buf, p)) > 0) out.append(buf, n);
    ::pclose(p);
    return out;
}

class TarnSQLiteDBTest : public test::ScratchRootTest {
protected:
    void SetUp() override {
        PlatformLogSetQuiet(true);
        // A failure inside a transaction is only survivable on a customer build.
        TarnGlobalConfiguration::sharedInstance().setIsInternalImage(false);
        root_.mkdirs("/db");
        path_ = root_.at("/db/containers.sqlite3");
        db_ = TarnSQLiteDB::initWithParentDirectoryURL(root_.at("/db"));
        ASSERT_TRUE(db_);
        ASSERT_EQ(db_->url(), path_);
    }

    void store(const std::string& id, const TarnCodeSigningEntryRef& entry) {
        TarnStatus stored = db_->addCodeSigningEntry(entry, id);
        ASSERT_TRUE(stored.ok()) << stored.error()->description();
    }

    // The stored entry; empty when the read failed.
    TarnCodeSigningEntryRef read(const std::string& id) {
        return db_->codeSigningEntryWithIdentifier(id).valueOr(nullptr);
    }
    // The code a read fails with; TarnSuccess when it succeeds.
    uint64_t readFailure(const std::string& id) {
        return db_->codeSigningEntryWithIdentifier(id).code(TarnSuccess);
    }
    std::set<std::string> identifiers() { return db_->identifiersWithError().value(); }

    std::string path_;
    std::unique_ptr<TarnSQLiteDB> db_;
};

TEST_F(TarnSQLiteDBTest, StoreInsertsThenUpdatesInPlace) {
    auto first = makeEntry("one");
    store("com.a", first);
    TarnCodeSigningEntryRef back = read("com.a");
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, *first);
    EXPECT_TRUE(back->childBundleIdentifiers().empty());
    const int64_t rowId = queryInt(db_->db(), "SELECT id FROM code_signing_info WHERE code_signing_id_text='com.a';");

    auto second = std::make_shared<TarnCodeSigningEntry>(*makeEntry("two", {}, 4));
    second->setInvalid(true);
    second->setRegisteredByCaller(true);
    second->setPlaceholder(true);
    store("com.a", second);
    back = read("com.a");
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, *second);
    EXPECT_EQ(back->dataContainerClass(), 4u);
    EXPECT_EQ(queryInt(db_->db(), "SELECT id FROM code_signing_info WHERE code_signing_id_text='com.a';"), rowId);
    EXPECT_EQ(queryInt(db_->db(), "SELECT count(*) FROM code_signing_info;"), 1);
    EXPECT_EQ(queryInt(db_->db(), "SELECT count(*) FROM code_signing_data;"), 1);

    // Children the new entry no longer lists stay recorded.
    store("com.a", makeEntry("three", {"com.a.x", "com.a.y"}));
    store("com.a", makeEntry("four", {"com.a.y"}));
    back = read("com.a");
    EXPECT_EQ(back->childBundleIdentifiers(), (std::vector<std::string>{"com.a.x", "com.a.y"}));
}

TEST_F(TarnSQLiteDBTest, DeleteCascadesAndUnknownIdentifierIs68WrappedAs66) {
    store("com.p", makeEntry("p", {"com.p.c1", "com.p.c2"}));
    store("com.q", makeEntry("q", {"com.q.c"}));
    ASSERT_TRUE(db_->deleteCodeSigningEntryWithIdentifier("com.p").ok());
    EXPECT_EQ(readFailure("com.p"), TarnErrorDatabaseNotFound);
    EXPECT_EQ(queryInt(db_->db(), "SELECT count(*) FROM code_signing_data;"), 1);
    EXPECT_EQ(queryInt(db_->db(), "SELECT count(*) FROM child_bundles;"), 1);
    EXPECT_EQ(db_->parentIdentifierForChildIdentifier("com.p.c1").code(TarnSuccess),
              TarnErrorDatabaseNotFound);

    TarnStatus unknown = db_->deleteCodeSigningEntryWithIdentifier("com.unknown");
    ASSERT_FALSE(unknown.ok());
    ASSERT_TRUE(unknown.error());
    EXPECT_EQ(unknown.error()->code(), TarnErrorDatabase);
    ASSERT_TRUE(unknown.error()->underlyingError());
    EXPECT_EQ(unknown.error()->underlyingError()->code(), TarnErrorDatabaseUnexpectedChanges);

    EXPECT_EQ(db_->deleteCodeSigningEntryWithIdentifier("").code(TarnSuccess), TarnErrorBadInput);
    EXPECT_EQ(db_->addCodeSigningEntry(nullptr, "com.x").code(TarnSuccess), TarnErrorBadInput);
    EXPECT_EQ(db_->addCodeSigningEntry(makeEntry("x"), "").code(TarnSuccess), TarnErrorBadInput);
}

TEST_F(TarnSQLiteDBTest, ChildMovesToSecondParent) {
    store("com.first", makeEntry("1", {"com.child", "com.other"}));
    store("com.second", makeEntry("2", {"com.child"}));
    EXPECT_EQ(db_->parentIdentifierForChildIdentifier("com.child").valueOr(""), "com.second");
    EXPECT_EQ(db_->childIdentifiersForParentIdentifier("com.first").valueOr({}),
              std::vector<std::string>{"com.other"});
    EXPECT_EQ(read("com.second")->childBundleIdentifiers(), std::vector<std::string>{"com.child"});
    EXPECT_EQ(db_->childIdentifiersForParentIdentifier("com.nobody").code(TarnSuccess),
              TarnErrorDatabaseNotFound);
}

TEST_F(TarnSQLiteDBTest, Invalidation) {
    EXPECT_TRUE(db_->invalidateCodeSigningWithIdentifier("com.unknown").ok());
    EXPECT_EQ(queryInt(db_->db(), "SELECT count(*) FROM code_signing_info;"), 0);

    store("com.p", makeEntry("p", {"com.p.c1", "com.p.c2"}));
    store("com.p.c1", makeEntry("c1"));
    store("com.lone", makeEntry("lone"));
    // com.p.c2 has no entry of its own: invalidating it changes nothing and is no failure.
    ASSERT_TRUE(db_->invalidateCodeSigningForIdentifierAndAllChildren("com.p").ok());
    EXPECT_TRUE(read("com.p")->invalid());
    EXPECT_TRUE(read("com.p.c1")->invalid());
    EXPECT_FALSE(read("com.lone")->invalid());
    // Without children only the identifier itself.
    ASSERT_TRUE(db_->invalidateCodeSigningForIdentifierAndAllChildren("com.lone").ok());
    EXPECT_TRUE(read("com.lone")->invalid());
    // Re-storing an invalidated entry makes it valid again.
    store("com.lone", makeEntry("lone"));
    EXPECT_FALSE(read("com.lone")->invalid());
}

TEST_F(TarnSQLiteDBTest, IdentifiersOfEmptyDatabaseAreEmptyWithoutError) {
    TarnResult<std::set<std::string>> none = db_->identifiersWithError();
    ASSERT_TRUE(none.ok());
    EXPECT_TRUE(none->empty());
    store("b", makeEntry("b"));
    store("a", makeEntry("a"));
    EXPECT_EQ(identifiers(), (std::set<std::string>{"a", "b"}));
}

TEST_F(TarnSQLiteDBTest, AdvanceCopyDeletionTakesOnlyFlag2) {
    auto placeholder = std::make_shared<TarnCodeSigningEntry>(*makeEntry("p"));
    placeholder->setPlaceholder(true);
    auto advance = std::make_shared<TarnCodeSigningEntry>(*makeEntry("a", {"com.adv.child"}));
    advance->setPlaceholder(true);
    advance->setAdvanceCopy(true);
    store("com.placeholder", placeholder);
    store("com.advance", advance);
    store("com.plain", makeEntry("plain"));
    EXPECT_EQ(queryInt(db_->db(), "SELECT placeholder FROM code_signing_info WHERE code_signing_id_text='com.placeholder';"), 1);
    EXPECT_EQ(queryInt(db_->db(), "SELECT placeholder FROM code_signing_info WHERE code_signing_id_text='com.advance';"), 3);
    TarnCodeSigningEntryRef back = read("com.advance");
    EXPECT_TRUE(back->placeholder());
    EXPECT_TRUE(back->advanceCopy());

    ASSERT_TRUE(db_->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError().ok());
    EXPECT_EQ(identifiers(), (std::set<std::string>{"com.placeholder", "com.plain"}));
    EXPECT_EQ(queryInt(db_->db(), "SELECT count(*) FROM child_bundles;"), 0);
    // Nothing left to delete is still success.
    EXPECT_TRUE(db_->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError().ok());
}

TEST_F(TarnSQLiteDBTest, UndecodableBlobFailsReadAndIsSkippedByEnumeration) {
    store("com.good", makeEntry("good", {"com.good.child"}));
    store("com.bad", makeEntry("bad"));
    store("com.array", makeEntry("array"));
    // Garbage bytes, and a valid property list whose root is not a dictionary.
    ASSERT_EQ(sqlite3_exec(db_->db(),
                           "UPDATE code_signing_data SET data=x'DEADBEEF' WHERE cs_info_id=(SELECT id FROM "
                           "code_signing_info WHERE code_signing_id_text='com.bad');",
                           nullptr, nullptr, nullptr),
              SQLITE_OK);
    std::vector<uint8_t> arrayPlist = PlistValue(PlistArray{"x"}).toBinary();
    sqlite3_stmt* st = nullptr;
    ASSERT_EQ(sqlite3_prepare_v2(db_->db(),
                                 "UPDATE code_signing_data SET data=? WHERE cs_info_id=(SELECT id FROM "
                                 "code_signing_info WHERE code_signing_id_text='com.array');",
                                 -1, &st, nullptr),
              SQLITE_OK);
    sqlite3_bind_blob(st, 1, arrayPlist.data(), static_cast<int>(arrayPlist.size()), SQLITE_TRANSIENT);
    ASSERT_EQ(sqlite3_step(st), SQLITE_DONE);
    sqlite3_finalize(st);

    for (const char* id : {"com.bad", "com.array"})
        EXPECT_EQ(readFailure(id), TarnErrorDatabase) << id;

    std::vector<std::string> seen;
    TarnStatus enumerated = db_->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& id, const TarnCodeSigningEntryRef& entry) {
            seen.push_back(id);
            EXPECT_EQ(entry->childBundleIdentifiers(), std::vector<std::string>{"com.good.child"});
        });
    EXPECT_EQ(seen, std::vector<std::string>{"com.good"});
    EXPECT_EQ(enumerated.code(TarnSuccess), TarnErrorDatabase);
    // The identifiers themselves are still listed.
    EXPECT_EQ(identifiers().size(), 3u);
}

TEST_F(TarnSQLiteDBTest, FailedStoreRollsBackTheFlagsRow) {
    // No info: the data row cannot be made after the flags row was inserted.
    auto noInfo = std::make_shared<const TarnCodeSigningEntry>();
    EXPECT_EQ(db_->addCodeSigningEntry(noInfo, "com.new").code(TarnSuccess), TarnErrorDatabase);
    EXPECT_TRUE(identifiers().empty());
    // The connection is usable afterwards: no transaction was left open.
    store("com.new", makeEntry("ok"));
    EXPECT_TRUE(read("com.new"));
}

TEST_F(TarnSQLiteDBTest, ExceptionInsideStoreIs40AndRollsBack) {
    store("com.a", makeEntry("before", {"com.a.kid"}));
    for (const char* step : {"info", "data", "children", "commit"}) {
        db_->TEST_storeStepHook = [step](const char* at) {
            if (std::string(at) == step) throw std::runtime_error("injected");
        };
        TarnStatus added = db_->addCodeSigningEntry(makeEntry("after", {"com.a.new"}, 6), "com.a");
        EXPECT_EQ(added.code(TarnSuccess), TarnErrorException) << step;
        db_->TEST_storeStepHook = nullptr;
        TarnCodeSigningEntryRef back = read("com.a");
        ASSERT_TRUE(back) << step;
        EXPECT_EQ(*back, *makeEntry("before", {"com.a.kid"})) << step;
    }
    store("com.a", makeEntry("after"));
    EXPECT_EQ(*read("com.a"), *makeEntry("after", {"com.a.kid"}));

    // An internal build stops with the report instead.
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    TarnGlobalConfiguration::sharedInstance().setIsInternalImage(true);
    db_->TEST_storeStepHook = [](const char*) { throw std::runtime_error("injected"); };
    EXPECT_DEATH((void)db_->addCodeSigningEntry(makeEntry("x"), "com.a"),
                 "INTERNAL ERROR: Uncaught Exception");
}

TEST_F(TarnSQLiteDBTest, ClosedStoreFailsWith66) {
    db_->closeDB();
    EXPECT_EQ(db_->db(), nullptr);
    EXPECT_EQ(db_->addCodeSigningEntry(makeEntry("x"), "com.x").code(TarnSuccess),
              TarnErrorDatabase);
    EXPECT_EQ(readFailure("com.x"), TarnErrorDatabase);
    EXPECT_EQ(db_->enumerateIdentifiersAndCodeSigningInfoUsingBlock([](auto&, auto&) { FAIL(); })
                  .code(TarnSuccess),
              TarnErrorDatabase);
}

TEST_F(TarnSQLiteDBTest, SchemaAsAnotherClientSeesIt) {
    store("com.a", makeEntry("a", {"com.a.c"}));
    db_.reset();  // the store holds the file exclusively while open

    const std::string q = "'" + path_ + "'";
    EXPECT_EQ(runCommand("sqlite3 " + q + " 'PRAGMA journal_mode;'"), "wal\n");
    EXPECT_EQ(runCommand("sqlite3 " + q + " \"SELECT sql FROM sqlite_master WHERE name NOT LIKE 'sqlite_%' ORDER BY rowid;\""),
              "CREATE TABLE code_signing_info(id INTEGER PRIMARY KEY AUTOINCREMENT,code_signing_id_text TEXT NOT "
              "NULL UNIQUE,invalid INTEGER NOT NULL DEFAULT 0,placeholder INTEGER NOT NULL DEFAULT "
              "0,registered_by_caller INTEGER NOT NULL DEFAULT 0,data_container_class INTEGER NOT NULL DEFAULT 0)\n"
              "CREATE TABLE code_signing_data(id INTEGER PRIMARY KEY AUTOINCREMENT,cs_info_id INTEGER NOT NULL "
              "UNIQUE,data BLOB NOT NULL,FOREIGN KEY(cs_info_id) REFERENCES code_signing_info(id) ON DELETE CASCADE)\n"
              "CREATE TABLE child_bundles(id INTEGER PRIMARY KEY AUTOINCREMENT,child_code_signing_id_text TEXT NOT "
              "NULL UNIQUE,parent_id INTEGER NOT NULL,FOREIGN KEY(parent_id) REFERENCES code_signing_info(id) ON "
              "DELETE CASCADE)\n"
              "CREATE INDEX code_signing_id_text_idx ON code_signing_info(code_signing_id_text)\n"
              "CREATE INDEX cs_info_id_idx ON code_signing_data(cs_info_id)\n"
              "CREATE INDEX parent_id_idx ON child_bundles(parent_id)\n");
    EXPECT_EQ(runCommand("sqlite3 " + q +
                         " \"SELECT i.code_signing_id_text, c.child_code_signing_id_text, length(d.data) > 0 FROM "
                         "code_signing_info i, code_signing_data d, child_bundles c WHERE d.cs_info_id=i.id AND "
                         "c.parent_id=i.id;\""),
              "com.a|com.a.c|1\n");

    // The blob is a binary property list another reader can decode.
    db_ = std::make_unique<TarnSQLiteDB>(path_);
    EXPECT_EQ(*read("com.a"), *makeEntry("a", {"com.a.c"}));
}

TEST_F(TarnSQLiteDBTest, OpenFailureStopsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(TarnSQLiteDB(root_.at("/missing/dir/containers.sqlite3")), "Failed to open database, err = 14");
    root_.writeFile("/db/garbage.sqlite3", std::string(8192, 'x'));
    EXPECT_DEATH(TarnSQLiteDB(root_.at("/db/garbage.sqlite3")), "Failed to initialize database, err = 26");
}

// ---- crash safety ----

constexpr const char* kWriterEnv = "TARN_TEST_CRASH_WRITER_DB";
// High enough that the writer never opens a file of its own under this number.
constexpr int kProgressFd = 100;
constexpr int kChildrenPerEntry = 3;

std::string payloadFor(uint64_t n) {
    std::string s(1024, 'a');
    for (size_t i = 0; i < s.size(); ++i) s[i] = static_cast<char>('a' + (n * 31 + i) % 26);
    return s;
}

// Not a test on its own: the body of the writer process the crash test kills.
TEST(TarnSQLiteDBCrashWriter, StoreUntilKilled) {
    const char* path = std::getenv(kWriterEnv);
    if (!path) GTEST_SKIP() << "runs only as the crash test's child";
    TarnSQLiteDB db(path);
    for (uint64_t n = 0;; ++n) {
        const std::string id = "com.crash." + std::to_string(n % 200);
        std::vector<std::string> children;
        for (int c = 0; c < kChildrenPerEntry; ++c) children.push_back(id + ".kid" + std::to_string(c));
        auto entry = std::make_shared<TarnCodeSigningEntry>(
            PlistDict{{"Generation", n}, {"Payload", payloadFor(n)}, {"Id", id}}, 2);
        entry->setChildBundleIdentifiers(children);
        if (!db.addCodeSigningEntry(entry, id).ok()) std::_Exit(3);
        char byte = 1;
        if (::write(kProgressFd, &byte, 1) != 1) std::_Exit(4);
    }
}

TEST_F(TarnSQLiteDBTest, KilledWriterLeavesWholeEntries) {
    db_.reset();
    for (int round = 0; round < 3; ++round) {
        int fds[2];
        // Close-on-exec for both ends; only the dup2 target survives into the writer.
        ASSERT_EQ(::pipe2(fds, O_CLOEXEC), 0);
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, fds[1], kProgressFd);
        posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
        std::string filter = "--gtest_filter=TarnSQLiteDBCrashWriter.StoreUntilKilled";
        std::string env = std::string(kWriterEnv) + "=" + path_;
        std::vector<char*> envp;
        for (char** e = environ; *e; ++e) envp.push_back(*e);
        envp.push_back(env.data());
        envp.push_back(nullptr);
        char self[] = "/proc/self/exe";
        char* argv[] = {self, filter.data(), nullptr};
        pid_t pid = 0;
        // A fresh process rather than a fork: the test process runs worker
        // threads whose locks a forked child could inherit held.
        ASSERT_EQ(posix_spawn(&pid, "/proc/self/exe", &actions, nullptr, argv, envp.data()), 0);
        posix_spawn_file_actions_destroy(&actions);
        ::close(fds[1]);

        // Let it commit a varying number of entries, then kill it mid-stream.
        const int wanted = 50 + round * 70;
        int committed = 0;
        char buf[64];
        while (committed < wanted) {
            ssize_t n = ::read(fds[0], buf, sizeof buf);
            ASSERT_GT(n, 0) << "writer died early";
            committed += static_cast<int>(n);
        }
        std::this_thread::sleep_for(std::chrono::microseconds(300 * (round + 1)));
        ASSERT_EQ(::kill(pid, SIGKILL), 0);
        int status = 0;
        ASSERT_EQ(::waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(WIFSIGNALED(status));
        ::close(fds[0]);

        TarnSQLiteDB db(path_);
        const std::set<std::string> ids = db.identifiersWithError().value();
        // Every commit the writer reported is there (ids cycle through 200).
        EXPECT_GE(ids.size(), std::min<size_t>(200, static_cast<size_t>(committed))) << "round " << round;
        size_t seen = 0;
        TarnStatus enumerated = db.enumerateIdentifiersAndCodeSigningInfoUsingBlock(
            [&](const std::string& id, const TarnCodeSigningEntryRef& entry) {
                ++seen;
                const PlistDict& info = *entry->codeSigningInfo();
                const uint64_t generation = *info.at("Generation").asUInt64();
                EXPECT_EQ(*info.at("Id").asString(), id);
                EXPECT_EQ(*info.at("Payload").asString(), payloadFor(generation));
                EXPECT_EQ(entry->childBundleIdentifiers().size(), static_cast<size_t>(kChildrenPerEntry)) << id;
            });
        EXPECT_TRUE(enumerated.ok()) << enumerated.error()->description();
        // No flags row without its data row: each store is all or nothing.
        EXPECT_EQ(seen, ids.size());
    }
}

}  // namespace
}  // namespace tarn
