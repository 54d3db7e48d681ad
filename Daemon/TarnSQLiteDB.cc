#include "Daemon/TarnSQLiteDB.h"

#include <sqlite3.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "Daemon/TarnExceptionFence.h"
#include "Platform/Failpoints.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

constexpr const char* kDatabaseFileName = "containers.sqlite3";

// Run as one exec at every open; every statement is idempotent. The switch to
// WAL writes the header of a new file, so the auto_vacuum line that follows it
// does not take effect on a file created here (SQLite fixes auto_vacuum when
// the header is first written).
constexpr const char* kInitStatements =
    "PRAGMA locking_mode = EXCLUSIVE;"
    "PRAGMA journal_mode = WAL;"
    "PRAGMA foreign_keys = ON;"
    "PRAGMA auto_vacuum = FULL;"
    "CREATE TABLE IF NOT EXISTS code_signing_info(id INTEGER PRIMARY KEY AUTOINCREMENT,"
    "code_signing_id_text TEXT NOT NULL UNIQUE,invalid INTEGER NOT NULL DEFAULT 0,"
    "placeholder INTEGER NOT NULL DEFAULT 0,registered_by_caller INTEGER NOT NULL DEFAULT 0,"
    "data_container_class INTEGER NOT NULL DEFAULT 0);"
    "CREATE TABLE IF NOT EXISTS code_signing_data(id INTEGER PRIMARY KEY AUTOINCREMENT,"
    "cs_info_id INTEGER NOT NULL UNIQUE,data BLOB NOT NULL,"
    "FOREIGN KEY(cs_info_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);"
    "CREATE TABLE IF NOT EXISTS child_bundles(id INTEGER PRIMARY KEY AUTOINCREMENT,"
    "child_code_signing_id_text TEXT NOT NULL UNIQUE,parent_id INTEGER NOT NULL,"
    "FOREIGN KEY(parent_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);"
    "CREATE INDEX IF NOT EXISTS code_signing_id_text_idx ON code_signing_info(code_signing_id_text);"
    "CREATE INDEX IF NOT EXISTS cs_info_id_idx ON code_signing_data(cs_info_id);"
    "CREATE INDEX IF NOT EXISTS parent_id_idx ON child_bundles(parent_id);";

constexpr const char* kSelectEntry =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM "
    "code_signing_info, code_signing_data WHERE code_signing_info.id = code_signing_data.cs_info_id "
    "AND code_signing_info.code_signing_id_text = ?;";
constexpr const char* kSelectAllEntries =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class, "
    "code_signing_info.code_signing_id_text FROM code_signing_info, code_signing_data WHERE "
    "code_signing_info.id = code_signing_data.cs_info_id;";
constexpr const char* kSelectIdentifiers =
    "SELECT code_signing_info.code_signing_id_text FROM code_signing_info;";
constexpr const char* kSelectChildren =
    "SELECT child_bundles.child_code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "code_signing_info.code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;";
constexpr const char* kSelectParent =
    "SELECT code_signing_info.code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "child_bundles.child_code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;";
constexpr const char* kUpdateFlags =
    "UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, "
    "data_container_class=? WHERE code_signing_id_text=?;";
constexpr const char* kInsertFlags =
    "INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, "
    "data_container_class, code_signing_id_text) VALUES (?, ?, ?, ?, ?);";
constexpr const char* kStoreData =
    "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM "
    "code_signing_info WHERE code_signing_id_text = ?;";
constexpr const char* kAddChild =
    "INSERT OR REPLACE INTO child_bundles (parent_id, child_code_signing_id_text) SELECT id, ? "
    "FROM code_signing_info WHERE code_signing_id_text = ?;";
constexpr const char* kInvalidate = "UPDATE code_signing_info SET invalid=1 WHERE code_signing_id_text = ?;";
constexpr const char* kDeleteEntry = "DELETE FROM code_signing_info WHERE code_signing_id_text=?;";
constexpr const char* kDeleteAdvanceCopies = "DELETE FROM code_signing_info WHERE (placeholder & ?) > 0;";

constexpr int kPlaceholderBit = 1;
constexpr int kAdvanceCopyBit = 2;

// The daemon cannot run without its database: open failures end the process.
[[noreturn]] void stopDaemon(const char* message) {
    TarnLog(kLogError, "openDBWithURL", "%s", message);
    // Also straight to stderr: the process ends before any log could be flushed.
    std::fprintf(stderr, "%s\n", message);
    PlatformLog("database", PlatformLogType::Fault, "%s", message);
    std::abort();
}

const char* textOrEmpty(const unsigned char* text) {
    return text ? reinterpret_cast<const char*>(text) : "";
}

TarnStatus statusOf(TarnErrorRef e) { return e ? TarnStatus(std::move(e)) : TarnStatus(); }

bool isNotFound(const TarnErrorRef& e) { return e && e->code() == TarnErrorDatabaseNotFound; }

}  // namespace

TarnSQLiteDB::TarnSQLiteDB(FileURL databaseURL) : url_(std::move(databaseURL)) {
    db_ = openDBWithURL(url_);
}

std::unique_ptr<TarnSQLiteDB> TarnSQLiteDB::initWithParentDirectoryURL(const FileURL& parentDirectory) {
    if (parentDirectory.empty() || parentDirectory.front() != '/') return nullptr;
    return std::make_unique<TarnSQLiteDB>(PathJoin(parentDirectory, kDatabaseFileName));
}

TarnSQLiteDB::~TarnSQLiteDB() { closeDB(); }

sqlite3* TarnSQLiteDB::openDBWithURL(const FileURL& url) {
    sqlite3* db = nullptr;
    int rc = sqlite3_open_v2(url.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
    if (rc != SQLITE_OK) {
        TarnLog(kLogError, "openDBWithURL", "opening %@ failed: %s", url,
                db ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
        sqlite3_close(db);
        char message[100];
        std::snprintf(message, sizeof message, "Failed to open database, err = %d", rc);
        stopDaemon(message);
    }
    char* execError = nullptr;
    rc = sqlite3_exec(db, kInitStatements, nullptr, nullptr, &execError);
    if (rc != SQLITE_OK) {
        TarnLog(kLogError, "openDBWithURL", "table create for %@ failed: %s", url,
                execError ? execError : sqlite3_errstr(rc));
        sqlite3_free(execError);
        sqlite3_close(db);
        char message[100];
        std::snprintf(message, sizeof message, "Failed to initialize database, err = %d", rc);
        stopDaemon(message);
    }
    TarnLog(kLogDebug, "openDBWithURL", "opening %@", url);
    return db;
}

std::vector<std::string> TarnSQLiteDB::integrityProblemsAtURL(const FileURL& url) {
    std::vector<std::string> problems;
    sqlite3* db = nullptr;
    int rc = sqlite3_open_v2(url.c_str(), &db, SQLITE_OPEN_READONLY, nullptr);
    sqlite3_stmt* statement = nullptr;
    if (rc == SQLITE_OK)
        rc = sqlite3_prepare_v2(db, "PRAGMA integrity_check;", -1, &statement, nullptr);
    while (rc == SQLITE_OK || rc == SQLITE_ROW) {
        rc = sqlite3_step(statement);
        if (rc != SQLITE_ROW) break;
        const auto* line = reinterpret_cast<const char*>(sqlite3_column_text(statement, 0));
        if (line && std::strcmp(line, "ok") != 0) problems.emplace_back(line);
    }
    if (rc != SQLITE_DONE)
        problems.emplace_back(std::string("cannot be checked: ") +
                              (db ? sqlite3_errmsg(db) : sqlite3_errstr(rc)));
    if (statement) sqlite3_finalize(statement);
    sqlite3_close(db);
    return problems;
}

void TarnSQLiteDB::closeDB() {
    if (!db_) return;
    TarnLog(kLogDebug, "closeDB", "closing %@", url_);
    if (selectEntry_) finalize(selectEntry_);
    selectEntry_ = nullptr;
    int rc = sqlite3_close(db_);
    if (rc != SQLITE_OK) TarnLog(kLogError, "closeDB", "sqlite3_close for %@ failed: %d", url_, rc);
    db_ = nullptr;
}

const char* TarnSQLiteDB::errmsg() const { return db_ ? sqlite3_errmsg(db_) : "database is closed"; }

void TarnSQLiteDB::finalize(sqlite3_stmt* statement) {
    if (sqlite3_finalize(statement) != SQLITE_OK) {
        TarnLog(kLogError, "finalize", "sqlite3_finalize for %@ failed: %s", url_, errmsg());
    }
}

void TarnSQLiteDB::runStoreStepHook(const char* step) {
    if (TEST_storeStepHook) TEST_storeStepHook(step);
}

// ---- exec and parameterised queries ----

TarnStatus TarnSQLiteDB::_sqliteExec(const char* statement) {
    char* message = nullptr;
    // A closed handle is refused here because sqlite3_exec does not check for it.
    int rc = db_ ? sqlite3_exec(db_, statement, nullptr, nullptr, &message) : SQLITE_MISUSE;
    if (rc == SQLITE_OK) return {};
    TarnErrorRef e = TARN_ERROR(TarnErrorDatabase, nullptr, "%@ on %@ failed: %s", statement, url_,
                                message ? message : errmsg());
    sqlite3_free(message);
    return e;
}

TarnStatus TarnSQLiteDB::_performSingleParameterQuery(const char* query, const std::string& withTextInput) {
    return _performTwoParameterQuery(query, withTextInput, nullptr, -1);
}

TarnStatus TarnSQLiteDB::_performSingleParameterQuery(const char* query, const std::string& withTextInput,
                                                      int expectedChanges) {
    return _performTwoParameterQuery(query, withTextInput, nullptr, expectedChanges);
}

TarnStatus TarnSQLiteDB::_performTwoParameterQuery(const char* query, const std::string& withTextInputOne,
                                                   const std::string* andTextInputTwo, int expectedChanges) {
    TarnErrorRef e;
    sqlite3_stmt* statement = nullptr;
    if (!db_ || sqlite3_prepare_v2(db_, query, -1, &statement, nullptr) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_prepare(insert) for %@ failed: %s", url_,
                       errmsg());
    } else if (sqlite3_bind_text(statement, 1, withTextInputOne.c_str(), -1, SQLITE_TRANSIENT) !=
               SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_bind_text for identifier=%@ at %@ failed: %s",
                       withTextInputOne, url_, errmsg());
    } else if (andTextInputTwo &&
               sqlite3_bind_text(statement, 2, andTextInputTwo->c_str(), -1, SQLITE_TRANSIENT) !=
                   SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_bind_text for identifier=%@ at %@ failed: %s",
                       *andTextInputTwo, url_, errmsg());
    } else if (sqlite3_step(statement) != SQLITE_DONE) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", url_, errmsg());
    } else if (expectedChanges != -1) {
        int changes = sqlite3_changes(db_);
        if (changes != expectedChanges) {
            e = TARN_ERROR(TarnErrorDatabaseUnexpectedChanges, nullptr,
                           "sqlite3_changes for %s in %@: %d, but expecting %d", query, url_, changes,
                           expectedChanges);
        }
    }
    if (statement) finalize(statement);
    return statusOf(std::move(e));
}

// ---- store ----

TarnStatus TarnSQLiteDB::_performInsertOrUpdateQuery(const char* query,
                                                     const TarnCodeSigningEntry& withCodeSigningEntry,
                                                     const std::string& forIdentifier, bool isUpdate) {
    const TarnCodeSigningEntry& entry = withCodeSigningEntry;
    const int invalid = entry.invalid() ? 1 : 0;
    const int flags = (entry.placeholder() ? kPlaceholderBit : 0) | (entry.advanceCopy() ? kAdvanceCopyBit : 0);
    const int registered = entry.registeredByCaller() ? 1 : 0;
    const uint64_t dataClass = entry.dataContainerClass();

    TarnErrorRef e;
    sqlite3_stmt* statement = nullptr;
    if (!db_ || sqlite3_prepare_v2(db_, query, -1, &statement, nullptr) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_prepare(insert) for %@ failed: %s", url_,
                       errmsg());
    } else if (sqlite3_bind_int(statement, 1, invalid) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_bind_int for invalid=%d at %@ failed: %s",
                       invalid, url_, errmsg());
    } else if (sqlite3_bind_int(statement, 2, flags) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr,
                       "sqlite3_bind_int for placeholder=%d, advance_copy=%d (flags=%d) at %@ failed: %s",
                       entry.placeholder(), entry.advanceCopy(), flags, url_, errmsg());
    } else if (sqlite3_bind_int(statement, 3, registered) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr,
                       "sqlite3_bind_int for registered_by_caller=%d at %@ failed: %s", registered, url_,
                       errmsg());
    } else if (sqlite3_bind_int64(statement, 4, static_cast<sqlite3_int64>(dataClass)) != SQLITE_OK) {
        // 64-bit so that no class value is silently truncated on its way in.
        e = TARN_ERROR(TarnErrorDatabase, nullptr,
                       "sqlite3_bind_int for data_container_class=%llu at %@ failed: %s", dataClass, url_,
                       errmsg());
    } else if (sqlite3_bind_text(statement, 5, forIdentifier.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_bind_text for code_signing_id=%@ at %@ failed: %s",
                       forIdentifier, url_, errmsg());
    } else if (sqlite3_step(statement) != SQLITE_DONE) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", url_, errmsg());
    } else if (isUpdate) {
        int changes = sqlite3_changes(db_);
        if (changes != 1) {
            // Silent: no row yet is the ordinary way to a first insert.
            e = TARN_ERROR_SILENT(TarnErrorDatabaseUnexpectedChanges, nullptr,
                                  "sqlite3_changes for %s in %@: %d, but expecting 1", query, url_, changes);
        }
    }
    if (statement) finalize(statement);
    return statusOf(std::move(e));
}

TarnStatus TarnSQLiteDB::_insertCodeSigningInfo(const TarnCodeSigningEntry& info,
                                                const std::string& forIdentifier) {
    TarnStatus updated = _performInsertOrUpdateQuery(kUpdateFlags, info, forIdentifier, /*isUpdate=*/true);
    if (updated.ok()) return {};
    if (updated.error()->code() != TarnErrorDatabaseUnexpectedChanges) {
        return TARN_ERROR(TarnErrorDatabase, updated.error(), "Error performing UPDATE operation for %@",
                          forIdentifier);
    }
    TarnStatus inserted = _performInsertOrUpdateQuery(kInsertFlags, info, forIdentifier, /*isUpdate=*/false);
    if (inserted.ok()) return {};
    return TARN_ERROR(TarnErrorDatabase, inserted.error(), "Error performing INSERT operation for %@",
                      forIdentifier);
}

TarnStatus TarnSQLiteDB::_insertCodeSigningData(const TarnCodeSigningEntry& data,
                                                const std::string& forIdentifier) {
    std::vector<uint8_t> blob;
    if (data.codeSigningInfo()) blob = PlistValue(*data.codeSigningInfo()).toBinary();
    if (blob.empty()) {
        std::optional<PlistValue> info;
        if (data.codeSigningInfo()) info = PlistValue(*data.codeSigningInfo());
        return TARN_ERROR(TarnErrorDatabase, nullptr, "Error creating data from code signing info: %@", info);
    }

    TarnErrorRef e;
    sqlite3_stmt* statement = nullptr;
    if (!db_ || sqlite3_prepare_v2(db_, kStoreData, -1, &statement, nullptr) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_prepare(insert) for %@ failed: %s", url_,
                       errmsg());
    } else if (sqlite3_bind_blob64(statement, 1, blob.data(), blob.size(), SQLITE_STATIC) != SQLITE_OK) {
        // Static: `blob` outlives the statement.
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_bind_blob64 for codeSigningInfoData at %@ failed: %s",
                       url_, errmsg());
    } else if (sqlite3_bind_text(statement, 2, forIdentifier.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr,
                       "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s", forIdentifier,
                       url_, errmsg());
    } else if (sqlite3_step(statement) != SQLITE_DONE) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", url_, errmsg());
    }
    if (statement) finalize(statement);
    return statusOf(std::move(e));
}

TarnStatus TarnSQLiteDB::_insertChildIdentifier(const std::string& childIdentifier,
                                                const std::string& forParentIdentifier) {
    TarnStatus added = _performTwoParameterQuery(kAddChild, childIdentifier, &forParentIdentifier, -1);
    if (added.ok()) return {};
    return TARN_ERROR(TarnErrorDatabase, added.error(), "Error performing INSERT operation for child %@",
                      childIdentifier);
}

TarnErrorRef TarnSQLiteDB::rollbackAfter(TarnErrorRef cause) {
    if (_sqliteExec("ROLLBACK;").ok()) return cause;
    return TARN_ERROR(TarnErrorDatabase, cause, "failed _sqliteExec rollback");
}

TarnStatus TarnSQLiteDB::commitTransaction() {
    // A failed commit (a full or failing disk) must leave the store as before.
    if (auto err = TARN_FAILPOINT("db.commit"))
        return rollbackAfter(TARN_POSIX_ERROR(*err, "COMMIT of %@", url_));
    TarnStatus committed = _sqliteExec("COMMIT;");
    if (committed.ok()) return {};
    TarnErrorRef e = TARN_ERROR(TarnErrorDatabase, committed.error(), "failed _sqliteExec commit");
    // A failed COMMIT can leave the transaction open; close it so the next
    // BEGIN does not fail too.
    if (db_ && !sqlite3_get_autocommit(db_)) e = rollbackAfter(e);
    return e;
}

template <class Body>
TarnStatus TarnSQLiteDB::inTransaction(const char* operation, Body&& body) {
    if (TarnStatus begun = _sqliteExec("BEGIN;"); !begun.ok())
        return TARN_ERROR_IN(operation, TarnErrorDatabase, begun.error(), "failed _sqliteExec begin");
    bool ended = false;  // the transaction was committed or rolled back without an exception
    TarnStatus status = TarnFenceExceptions(operation, [&]() -> TarnStatus {
        TarnStatus done = body();
        if (!done.ok()) {
            TarnErrorRef e = rollbackAfter(done.error());
            ended = true;
            return e;
        }
        runStoreStepHook("commit");
        TarnStatus committed = commitTransaction();
        ended = true;
        return committed;
    });
    // Only an open transaction can be rolled back; the exception may have hit
    // after COMMIT or a ROLLBACK took effect.
    if (!ended && db_ && !sqlite3_get_autocommit(db_)) {
        // The operation fails with TarnErrorException either way; the exec
        // already logged.
        (void)_sqliteExec("ROLLBACK;");
    }
    return status;
}

TarnStatus TarnSQLiteDB::addCodeSigningEntry(const TarnCodeSigningEntryRef& codeSigningEntry,
                                             const std::string& withIdentifier) {
    if (!codeSigningEntry || withIdentifier.empty()) {
        return TARN_ERROR(TarnErrorBadInput, nullptr, "codeSigningEntry %@ and identifier %@ cannot be nil",
                          codeSigningEntry, withIdentifier.empty() ? "(null)" : withIdentifier);
    }
    return inTransaction("addCodeSigningEntry", [&]() -> TarnStatus {
        runStoreStepHook("info");
        TARN_TRY(_insertCodeSigningInfo(*codeSigningEntry, withIdentifier));
        runStoreStepHook("data");
        TARN_TRY(_insertCodeSigningData(*codeSigningEntry, withIdentifier));
        runStoreStepHook("children");
        for (const std::string& child : codeSigningEntry->childBundleIdentifiers()) {
            // A child that cannot be recorded must not cost the parent its entry.
            (void)_insertChildIdentifier(child, withIdentifier);
        }
        return {};
    });
}

// ---- reads ----

TarnResult<std::shared_ptr<TarnCodeSigningEntry>> TarnSQLiteDB::_codeSigningEntryFromStatementRow(
    sqlite3_stmt* statement) {
    const void* blob = sqlite3_column_blob(statement, 0);
    const int length = sqlite3_column_bytes(statement, 0);
    if (!blob || length <= 0) {
        return TARN_ERROR(TarnErrorDatabase, nullptr, "Failed to create code signing entry from statement row");
    }
    std::optional<PlistValue> parsed;
    if (static_cast<size_t>(length) <= kMaxPlistBytes) parsed = PlistValue::fromBytes(blob, static_cast<size_t>(length));
    if (!parsed || !parsed->isDict()) {
        return TARN_ERROR(TarnErrorDatabase, nullptr, "Error formatting info data from DB");
    }
    auto entry = std::make_shared<TarnCodeSigningEntry>(std::move(*parsed->asDict()));
    entry->setInvalid(sqlite3_column_int(statement, 1) != 0);
    const int flags = sqlite3_column_int(statement, 2);
    entry->setPlaceholder((flags & kPlaceholderBit) != 0);
    entry->setAdvanceCopy((flags & kAdvanceCopyBit) != 0);
    entry->setRegisteredByCaller(sqlite3_column_int(statement, 3) != 0);
    entry->setDataContainerClass(static_cast<uint64_t>(sqlite3_column_int64(statement, 4)));
    return entry;
}

TarnResult<std::shared_ptr<TarnCodeSigningEntry>> TarnSQLiteDB::_selectCodeSigningEntryWithIdentifier(
    const std::string& identifier) {
    TarnErrorRef e;
    std::shared_ptr<TarnCodeSigningEntry> entry;
    // Every request that checks entitlements asks this: the statement is
    // compiled once and reset after each use.
    if (db_ && !selectEntry_ &&
        sqlite3_prepare_v3(db_, kSelectEntry, -1, SQLITE_PREPARE_PERSISTENT, &selectEntry_, nullptr) !=
            SQLITE_OK)
        selectEntry_ = nullptr;
    sqlite3_stmt* statement = selectEntry_;
    if (!statement) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_prepare(select) for %@ failed: %s", url_, errmsg());
    } else if (sqlite3_bind_text(statement, 1, identifier.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s",
                       identifier, url_, errmsg());
    } else {
        int rc = sqlite3_step(statement);
        if (rc == SQLITE_ROW) {
            TarnResult<std::shared_ptr<TarnCodeSigningEntry>> decoded =
                _codeSigningEntryFromStatementRow(statement);
            if (decoded.ok())
                entry = std::move(*decoded);
            else
                e = decoded.error();
        } else if (rc != SQLITE_DONE) {
            e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", url_, errmsg());
        }
    }
    // Reset at once: a statement left mid-step would hold its read snapshot.
    if (statement) {
        sqlite3_reset(statement);
        sqlite3_clear_bindings(statement);
    }
    if (e) return e;
    return entry;
}

TarnResult<TarnCodeSigningEntryRef> TarnSQLiteDB::codeSigningEntryWithIdentifier(const std::string& identifier) {
    TarnResult<std::shared_ptr<TarnCodeSigningEntry>> selected =
        _selectCodeSigningEntryWithIdentifier(identifier);
    if (!selected.ok()) {
        TarnLog(kLogError, "codeSigningEntryWithIdentifier", "Error retrieving code signing entry: %@",
                selected.error());
        return selected.error();
    }
    std::shared_ptr<TarnCodeSigningEntry>& entry = *selected;
    if (!entry) {
        // Silent: a missing entry is an everyday answer, not a fault.
        return TARN_ERROR_SILENT(TarnErrorDatabaseNotFound, nullptr, "Identifier: \"%@\" Not Found in DB",
                                 identifier);
    }
    TarnResult<std::vector<std::string>> children = childIdentifiersForParentIdentifier(identifier);
    if (children.ok()) {
        entry->setChildBundleIdentifiers(std::move(*children));
    } else if (!isNotFound(children.error())) {
        TarnLog(kLogError, "codeSigningEntryWithIdentifier", "Error retrieving childBundleIds: %@",
                children.error());
        return children.error();
    }
    return TarnCodeSigningEntryRef(std::move(entry));
}

template <class Row>
TarnStatus TarnSQLiteDB::_selectRows(const char* function, const char* query,
                                     const std::string* textInput, const char* column, Row&& row) {
    TarnErrorRef e;
    sqlite3_stmt* statement = nullptr;
    if (!db_ || sqlite3_prepare_v2(db_, query, -1, &statement, nullptr) != SQLITE_OK) {
        e = TARN_ERROR_IN(function, TarnErrorDatabase, nullptr,
                          "sqlite3_prepare(select) for %@ failed: %s", url_, errmsg());
    } else if (textInput && sqlite3_bind_text(statement, 1, textInput->c_str(), -1,
                                              SQLITE_TRANSIENT) != SQLITE_OK) {
        e = TARN_ERROR_IN(function, TarnErrorDatabase, nullptr,
                          "sqlite3_bind_text for %s=%@ at %@ failed: %s", column, *textInput, url_,
                          errmsg());
    } else {
        for (;;) {
            const int rc = sqlite3_step(statement);
            if (rc == SQLITE_DONE) break;
            if (rc != SQLITE_ROW) {
                e = TARN_ERROR_IN(function, TarnErrorDatabase, nullptr,
                                  "sqlite3_step for %@ failed: %s", url_, errmsg());
                break;
            }
            row(statement);
        }
    }
    if (statement) finalize(statement);
    return statusOf(std::move(e));
}

TarnStatus TarnSQLiteDB::enumerateIdentifiersAndCodeSigningInfoUsingBlock(const EntryBlock& block) {
    // A bad row is skipped; the answer is the last failure.
    TarnErrorRef lastError;
    TARN_TRY(
        _selectRows(__func__, kSelectAllEntries, nullptr, nullptr, [&](sqlite3_stmt* statement) {
            // Everything made for this row lives in this scope only, so memory
            // stays flat however many rows there are.
            TarnResult<std::shared_ptr<TarnCodeSigningEntry>> decoded =
                _codeSigningEntryFromStatementRow(statement);
            if (!decoded.ok()) {
                lastError = decoded.error();
                return;
            }
            std::shared_ptr<TarnCodeSigningEntry>& entry = *decoded;
            const unsigned char* text = sqlite3_column_text(statement, 5);
            if (!text) {
                lastError = TARN_ERROR_IN("enumerateIdentifiersAndCodeSigningInfoUsingBlock",
                                          TarnErrorDatabase, nullptr,
                                          "Error retrieving code_signing_id_text from DB");
                return;
            }
            std::string identifier(textOrEmpty(text));
            TarnResult<std::vector<std::string>> children =
                childIdentifiersForParentIdentifier(identifier);
            if (children.ok()) {
                entry->setChildBundleIdentifiers(std::move(*children));
            } else if (!isNotFound(children.error())) {
                lastError = TARN_ERROR_IN("enumerateIdentifiersAndCodeSigningInfoUsingBlock",
                                          TarnErrorDatabase, children.error(),
                                          "Error retrieving childBundleIds: %@", children.error());
                return;
            }
            block(identifier, entry);
        }));
    return statusOf(std::move(lastError));
}

TarnResult<std::set<std::string>> TarnSQLiteDB::identifiersWithError() {
    std::set<std::string> identifiers;
    const TarnStatus selected =
        _selectRows(__func__, kSelectIdentifiers, nullptr, nullptr, [&](sqlite3_stmt* statement) {
            const unsigned char* text = sqlite3_column_text(statement, 0);
            if (!text) {
                TarnLog(kLogError, "identifiersWithError",
                        "Error retrieving code_signing_id_text from DB");
                return;
            }
            identifiers.emplace(textOrEmpty(text));
        });
    // What could be read is the answer; a failure only when nothing could.
    if (identifiers.empty() && !selected.ok()) return selected.error();
    return identifiers;
}

TarnResult<std::vector<std::string>> TarnSQLiteDB::childIdentifiersForParentIdentifier(
    const std::string& identifier) {
    std::vector<std::string> children;
    TARN_TRY(_selectRows(__func__, kSelectChildren, &identifier, "code_signing_id_text",
                         [&](sqlite3_stmt* statement) {
                             const unsigned char* text = sqlite3_column_text(statement, 0);
                             if (text) children.emplace_back(textOrEmpty(text));
                         }));
    if (children.empty()) {
        // Silent: most entries have no children.
        return TARN_ERROR_SILENT(TarnErrorDatabaseNotFound, nullptr,
                                 "Children for parent identifier: \"%@\" Not Found in DB",
                                 identifier);
    }
    return children;
}

TarnResult<std::string> TarnSQLiteDB::parentIdentifierForChildIdentifier(
    const std::string& identifier) {
    std::optional<std::string> parent;
    TARN_TRY(_selectRows(__func__, kSelectParent, &identifier, "child_code_signing_id_text",
                         [&](sqlite3_stmt* statement) {
                             const unsigned char* text = sqlite3_column_text(statement, 0);
                             if (text) parent = textOrEmpty(text);
                         }));
    if (!parent) {
        return TARN_ERROR_SILENT(TarnErrorDatabaseNotFound, nullptr,
                                 "Parent identifier for: \"%@\" Not Found in DB", identifier);
    }
    return std::move(*parent);
}

// ---- invalidation and deletion ----

TarnStatus TarnSQLiteDB::invalidateCodeSigningWithIdentifier(const std::string& identifier) {
    TarnStatus updated = _performSingleParameterQuery(kInvalidate, identifier);
    if (updated.ok()) return {};
    return TARN_ERROR(TarnErrorDatabase, updated.error(), "failed to invalidate identifier %@", identifier);
}

TarnStatus TarnSQLiteDB::invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier) {
    TarnResult<std::vector<std::string>> children = childIdentifiersForParentIdentifier(identifier);
    if (!children.ok() && !isNotFound(children.error())) {
        return TARN_ERROR(TarnErrorDatabase, children.error(),
                          "Error retrieving child bundles ids from DB with identifier %@ : %@", identifier,
                          children.error());
    }
    std::vector<std::string> identifiers;
    if (children.ok()) identifiers = std::move(*children);
    identifiers.insert(identifiers.begin(), identifier);

    return inTransaction("invalidateCodeSigningForIdentifierAndAllChildren", [&]() -> TarnStatus {
        for (const std::string& child : identifiers) {
            TarnStatus invalidated = invalidateCodeSigningWithIdentifier(child);
            if (!invalidated.ok()) {
                TarnLog(kLogError, "invalidateCodeSigningForIdentifierAndAllChildren",
                        "Failed to invalidate code signing info for %@ child %@ : %@", identifier, child,
                        invalidated.error());
            } else {
                TarnLog(kLogDebug, "invalidateCodeSigningForIdentifierAndAllChildren",
                        "Invalidating code signing info for %@ child: %@", identifier, child);
            }
        }
        return {};
    });
}

TarnStatus TarnSQLiteDB::_deleteCodeSigningWithIdentifier(const std::string& identifier) {
    return _performSingleParameterQuery(kDeleteEntry, identifier, 1);
}

TarnStatus TarnSQLiteDB::deleteCodeSigningEntryWithIdentifier(const std::string& identifier) {
    if (identifier.empty()) {
        return TARN_ERROR(TarnErrorBadInput, nullptr, "identifier %@ cannot be nil", "(null)");
    }
    TarnStatus deleted = _deleteCodeSigningWithIdentifier(identifier);
    if (deleted.ok()) return {};
    return TARN_ERROR(TarnErrorDatabase, deleted.error(), "failed to delete from code_signing_info");
}

TarnStatus TarnSQLiteDB::deleteAllAdvanceCopiesOfCodeSigningEntriesWithError() {
    TarnErrorRef e;
    sqlite3_stmt* statement = nullptr;
    if (!db_ || sqlite3_prepare_v2(db_, kDeleteAdvanceCopies, -1, &statement, nullptr) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_prepare(delete) for %@ failed: %s", url_, errmsg());
    } else if (sqlite3_bind_int(statement, 1, kAdvanceCopyBit) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_bind_text for flags=%d at %@ failed: %s", kAdvanceCopyBit,
                       url_, errmsg());
    } else if (sqlite3_step(statement) != SQLITE_DONE) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", url_, errmsg());
    } else if (int deleted = sqlite3_changes(db_); deleted > 0) {
        TarnLog(kLogError, "deleteAllAdvanceCopiesOfCodeSigningEntriesWithError",
                "Deleted %d advance copies of code signing info.", deleted);
    }
    if (statement) finalize(statement);
    return statusOf(std::move(e));
}

}  // namespace tarn
