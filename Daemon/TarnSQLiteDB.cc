#include "Daemon/TarnSQLiteDB.h"

#include <sqlite3.h>

#include <cstdio>
#include <cstdlib>
#include <exception>
#include <typeinfo>

#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnRequestProcessor.h"
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

bool isInternalBuild() { return TarnGlobalConfiguration::sharedInstance().isInternalImage(); }

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

bool TarnSQLiteDB::_sqliteExec(const char* statement, TarnErrorRef* error) {
    char* message = nullptr;
    // A closed handle is refused here because sqlite3_exec does not check for it.
    int rc = db_ ? sqlite3_exec(db_, statement, nullptr, nullptr, &message) : SQLITE_MISUSE;
    if (rc == SQLITE_OK) return true;
    TarnErrorRef e = TARN_ERROR(TarnErrorDatabase, nullptr, "%@ on %@ failed: %s", statement, url_,
                                message ? message : errmsg());
    sqlite3_free(message);
    if (error) *error = e;
    return false;
}

bool TarnSQLiteDB::_performSingleParameterQuery(const char* query, const std::string& withTextInput,
                                                TarnErrorRef* error) {
    return _performTwoParameterQuery(query, withTextInput, nullptr, -1, error);
}

bool TarnSQLiteDB::_performSingleParameterQuery(const char* query, const std::string& withTextInput,
                                                int expectedChanges, TarnErrorRef* error) {
    return _performTwoParameterQuery(query, withTextInput, nullptr, expectedChanges, error);
}

bool TarnSQLiteDB::_performTwoParameterQuery(const char* query, const std::string& withTextInputOne,
                                             const std::string* andTextInputTwo, int expectedChanges,
                                             TarnErrorRef* error) {
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
    if (e && error) *error = e;
    return !e;
}

// ---- store ----

bool TarnSQLiteDB::_performInsertOrUpdateQuery(const char* query,
                                               const TarnCodeSigningEntry& withCodeSigningEntry,
                                               const std::string& forIdentifier, bool isUpdate,
                                               TarnErrorRef* error) {
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
    if (e && error) *error = e;
    return !e;
}

bool TarnSQLiteDB::_insertCodeSigningInfo(const TarnCodeSigningEntry& info, const std::string& forIdentifier,
                                          TarnErrorRef* error) {
    TarnErrorRef updateError;
    if (_performInsertOrUpdateQuery(kUpdateFlags, info, forIdentifier, true, &updateError)) return true;
    if (updateError->code() != TarnErrorDatabaseUnexpectedChanges) {
        if (error) {
            *error = TARN_ERROR(TarnErrorDatabase, updateError, "Error performing UPDATE operation for %@",
                                forIdentifier);
        }
        return false;
    }
    TarnErrorRef insertError;
    if (_performInsertOrUpdateQuery(kInsertFlags, info, forIdentifier, false, &insertError)) return true;
    if (error) {
        *error = TARN_ERROR(TarnErrorDatabase, insertError, "Error performing INSERT operation for %@",
                            forIdentifier);
    }
    return false;
}

bool TarnSQLiteDB::_insertCodeSigningData(const TarnCodeSigningEntry& data, const std::string& forIdentifier,
                                          TarnErrorRef* error) {
    std::vector<uint8_t> blob;
    if (data.codeSigningInfo()) blob = PlistValue(*data.codeSigningInfo()).toBinary();
    if (blob.empty()) {
        std::optional<PlistValue> info;
        if (data.codeSigningInfo()) info = PlistValue(*data.codeSigningInfo());
        TarnErrorRef e = TARN_ERROR(TarnErrorDatabase, nullptr, "Error creating data from code signing info: %@",
                                    info);
        if (error) *error = e;
        return false;
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
    if (e && error) *error = e;
    return !e;
}

bool TarnSQLiteDB::_insertChildIdentifier(const std::string& childIdentifier,
                                          const std::string& forParentIdentifier, TarnErrorRef* error) {
    TarnErrorRef e;
    if (_performTwoParameterQuery(kAddChild, childIdentifier, &forParentIdentifier, -1, &e)) return true;
    if (error) {
        *error = TARN_ERROR(TarnErrorDatabase, e, "Error performing INSERT operation for child %@",
                            childIdentifier);
    }
    return false;
}

TarnErrorRef TarnSQLiteDB::rollbackAfter(TarnErrorRef cause) {
    TarnErrorRef rollbackError;
    if (_sqliteExec("ROLLBACK;", &rollbackError)) return cause;
    return TARN_ERROR(TarnErrorDatabase, cause, "failed _sqliteExec rollback");
}

TarnErrorRef TarnSQLiteDB::commitTransaction() {
    TarnErrorRef execError;
    if (_sqliteExec("COMMIT;", &execError)) return nullptr;
    TarnErrorRef e = TARN_ERROR(TarnErrorDatabase, execError, "failed _sqliteExec commit");
    // A failed COMMIT can leave the transaction open; close it so the next
    // BEGIN does not fail too.
    if (db_ && !sqlite3_get_autocommit(db_)) e = rollbackAfter(e);
    return e;
}

TarnErrorRef TarnSQLiteDB::handleTransactionException(const char* operation,
                                                      const std::exception* exception) {
    // The daemon's own report on internal builds, with its crash message slot.
    if (isInternalBuild()) TarnFatalExceptionReport(exception);
    TarnErrorRef e = TARN_ERROR_IN(operation, TarnErrorException, nullptr, "Got exception: %@ : %@",
                                   exception ? typeid(*exception).name() : "unknown exception",
                                   exception ? exception->what() : "");
    // Only an open transaction can be rolled back; the failure may have hit
    // before BEGIN took effect or after COMMIT.
    if (db_ && !sqlite3_get_autocommit(db_)) {
        TarnErrorRef rollbackError;
        // The operation fails with 40 either way; the exec already logged.
        (void)_sqliteExec("ROLLBACK;", &rollbackError);
    }
    return e;
}

bool TarnSQLiteDB::addCodeSigningEntry(const TarnCodeSigningEntryRef& codeSigningEntry,
                                       const std::string& withIdentifier, TarnErrorRef* error) {
    if (!codeSigningEntry || withIdentifier.empty()) {
        TarnErrorRef e = TARN_ERROR(TarnErrorBadInput, nullptr, "codeSigningEntry %@ and identifier %@ cannot be nil",
                                    codeSigningEntry, withIdentifier.empty() ? "(null)" : withIdentifier);
        if (error) *error = e;
        return false;
    }
    TarnErrorRef execError;
    if (!_sqliteExec("BEGIN;", &execError)) {
        TarnErrorRef e = TARN_ERROR(TarnErrorDatabase, execError, "failed _sqliteExec begin");
        if (error) *error = e;
        return false;
    }

    TarnErrorRef e;
    try {
        runStoreStepHook("info");
        if (!_insertCodeSigningInfo(*codeSigningEntry, withIdentifier, &e)) {
            e = rollbackAfter(e);
        } else {
            runStoreStepHook("data");
            if (!_insertCodeSigningData(*codeSigningEntry, withIdentifier, &e)) {
                e = rollbackAfter(e);
            } else {
                runStoreStepHook("children");
                for (const std::string& child : codeSigningEntry->childBundleIdentifiers()) {
                    TarnErrorRef childError;
                    // A child that cannot be recorded must not cost the parent its entry.
                    (void)_insertChildIdentifier(child, withIdentifier, &childError);
                }
                runStoreStepHook("commit");
                e = commitTransaction();
            }
        }
    } catch (const std::exception& ex) {
        e = handleTransactionException("addCodeSigningEntry", &ex);
    } catch (...) {
        e = handleTransactionException("addCodeSigningEntry", nullptr);
    }
    if (e && error) *error = e;
    return !e;
}

// ---- reads ----

std::shared_ptr<TarnCodeSigningEntry> TarnSQLiteDB::_codeSigningEntryFromStatementRow(sqlite3_stmt* statement,
                                                                                      TarnErrorRef* error) {
    const void* blob = sqlite3_column_blob(statement, 0);
    const int length = sqlite3_column_bytes(statement, 0);
    if (!blob || length <= 0) {
        if (error) *error = TARN_ERROR(TarnErrorDatabase, nullptr, "Failed to create code signing entry from statement row");
        return nullptr;
    }
    std::optional<PlistValue> parsed;
    if (static_cast<size_t>(length) <= kMaxPlistBytes) parsed = PlistValue::fromBytes(blob, static_cast<size_t>(length));
    if (!parsed || !parsed->isDict()) {
        if (error) *error = TARN_ERROR(TarnErrorDatabase, nullptr, "Error formatting info data from DB");
        return nullptr;
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

std::shared_ptr<TarnCodeSigningEntry> TarnSQLiteDB::_selectCodeSigningEntryWithIdentifier(
    const std::string& identifier, TarnErrorRef* error) {
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
            entry = _codeSigningEntryFromStatementRow(statement, &e);
        } else if (rc != SQLITE_DONE) {
            e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", url_, errmsg());
        }
    }
    // Reset at once: a statement left mid-step would hold its read snapshot.
    if (statement) {
        sqlite3_reset(statement);
        sqlite3_clear_bindings(statement);
    }
    if (e && error) *error = e;
    return entry;
}

TarnCodeSigningEntryRef TarnSQLiteDB::codeSigningEntryWithIdentifier(const std::string& identifier,
                                                                     TarnErrorRef* error) {
    TarnErrorRef e;
    std::shared_ptr<TarnCodeSigningEntry> entry = _selectCodeSigningEntryWithIdentifier(identifier, &e);
    if (!entry) {
        if (!e) {
            // Silent: a missing entry is an everyday answer, not a fault.
            e = TARN_ERROR_SILENT(TarnErrorDatabaseNotFound, nullptr, "Identifier: \"%@\" Not Found in DB",
                                  identifier);
        } else {
            TarnLog(kLogError, "codeSigningEntryWithIdentifier", "Error retrieving code signing entry: %@", e);
        }
        if (error) *error = e;
        return nullptr;
    }
    TarnErrorRef childError;
    std::vector<std::string> children = childIdentifiersForParentIdentifier(identifier, &childError);
    if (!children.empty()) {
        entry->setChildBundleIdentifiers(std::move(children));
    } else if (childError && childError->code() != TarnErrorDatabaseNotFound) {
        TarnLog(kLogError, "codeSigningEntryWithIdentifier", "Error retrieving childBundleIds: %@", childError);
        if (error) *error = childError;
        return nullptr;
    }
    return entry;
}

TarnErrorRef TarnSQLiteDB::enumerateIdentifiersAndCodeSigningInfoUsingBlock(const EntryBlock& block) {
    TarnErrorRef lastError;
    sqlite3_stmt* statement = nullptr;
    if (!db_ || sqlite3_prepare_v2(db_, kSelectAllEntries, -1, &statement, nullptr) != SQLITE_OK) {
        lastError = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_prepare(select) for %@ failed: %s", url_,
                               errmsg());
        if (statement) finalize(statement);
        return lastError;
    }
    for (;;) {
        int rc = sqlite3_step(statement);
        if (rc == SQLITE_DONE) break;
        if (rc != SQLITE_ROW) {
            lastError = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", url_, errmsg());
            break;
        }
        // Everything made for this row lives in this scope only, so memory
        // stays flat however many rows there are.
        TarnErrorRef rowError;
        std::shared_ptr<TarnCodeSigningEntry> entry = _codeSigningEntryFromStatementRow(statement, &rowError);
        if (!entry) {
            lastError = rowError;
            continue;
        }
        const unsigned char* text = sqlite3_column_text(statement, 5);
        if (!text) {
            lastError = TARN_ERROR(TarnErrorDatabase, nullptr, "Error retrieving code_signing_id_text from DB");
            continue;
        }
        std::string identifier(textOrEmpty(text));
        TarnErrorRef childError;
        std::vector<std::string> children = childIdentifiersForParentIdentifier(identifier, &childError);
        if (!children.empty()) {
            entry->setChildBundleIdentifiers(std::move(children));
        } else if (childError && childError->code() != TarnErrorDatabaseNotFound) {
            lastError = TARN_ERROR(TarnErrorDatabase, childError, "Error retrieving childBundleIds: %@", childError);
            continue;
        }
        block(identifier, entry);
    }
    finalize(statement);
    return lastError;
}

std::set<std::string> TarnSQLiteDB::identifiersWithError(TarnErrorRef* error) {
    std::set<std::string> identifiers;
    TarnErrorRef lastError;
    sqlite3_stmt* statement = nullptr;
    if (!db_ || sqlite3_prepare_v2(db_, kSelectIdentifiers, -1, &statement, nullptr) != SQLITE_OK) {
        lastError = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_prepare(select) for %@ failed: %s", url_,
                               errmsg());
    } else {
        for (;;) {
            int rc = sqlite3_step(statement);
            if (rc == SQLITE_DONE) break;
            if (rc != SQLITE_ROW) {
                lastError = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", url_, errmsg());
                break;
            }
            const unsigned char* text = sqlite3_column_text(statement, 0);
            if (!text) {
                TarnLog(kLogError, "identifiersWithError", "Error retrieving code_signing_id_text from DB");
                continue;
            }
            identifiers.emplace(textOrEmpty(text));
        }
    }
    if (statement) finalize(statement);
    if (identifiers.empty() && lastError && error) *error = lastError;
    return identifiers;
}

std::vector<std::string> TarnSQLiteDB::childIdentifiersForParentIdentifier(const std::string& identifier,
                                                                          TarnErrorRef* error) {
    std::vector<std::string> children;
    TarnErrorRef e;
    sqlite3_stmt* statement = nullptr;
    if (!db_ || sqlite3_prepare_v2(db_, kSelectChildren, -1, &statement, nullptr) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_prepare(select) for %@ failed: %s", url_, errmsg());
    } else if (sqlite3_bind_text(statement, 1, identifier.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s",
                       identifier, url_, errmsg());
    } else {
        for (;;) {
            int rc = sqlite3_step(statement);
            if (rc == SQLITE_DONE) break;
            if (rc != SQLITE_ROW) {
                e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", url_, errmsg());
                children.clear();
                break;
            }
            const unsigned char* text = sqlite3_column_text(statement, 0);
            if (text) children.emplace_back(textOrEmpty(text));
        }
        if (!e && children.empty()) {
            // Silent: most entries have no children.
            e = TARN_ERROR_SILENT(TarnErrorDatabaseNotFound, nullptr,
                                  "Children for parent identifier: \"%@\" Not Found in DB", identifier);
        }
    }
    if (statement) finalize(statement);
    if (e && error) *error = e;
    return children;
}

std::string TarnSQLiteDB::parentIdentifierForChildIdentifier(const std::string& identifier, TarnErrorRef* error) {
    std::string parent;
    bool found = false;
    TarnErrorRef e;
    sqlite3_stmt* statement = nullptr;
    if (!db_ || sqlite3_prepare_v2(db_, kSelectParent, -1, &statement, nullptr) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_prepare(select) for %@ failed: %s", url_, errmsg());
    } else if (sqlite3_bind_text(statement, 1, identifier.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
        e = TARN_ERROR(TarnErrorDatabase, nullptr,
                       "sqlite3_bind_text for child_code_signing_id_text=%@ at %@ failed: %s", identifier, url_,
                       errmsg());
    } else {
        for (;;) {
            int rc = sqlite3_step(statement);
            if (rc == SQLITE_DONE) break;
            if (rc != SQLITE_ROW) {
                e = TARN_ERROR(TarnErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", url_, errmsg());
                break;
            }
            const unsigned char* text = sqlite3_column_text(statement, 0);
            if (text) {
                parent = textOrEmpty(text);
                found = true;
            }
        }
        if (!e && !found) {
            e = TARN_ERROR_SILENT(TarnErrorDatabaseNotFound, nullptr, "Parent identifier for: \"%@\" Not Found in DB",
                                  identifier);
        }
    }
    if (statement) finalize(statement);
    if (e) {
        parent.clear();
        if (error) *error = e;
    }
    return parent;
}

// ---- invalidation and deletion ----

bool TarnSQLiteDB::invalidateCodeSigningWithIdentifier(const std::string& identifier, TarnErrorRef* error) {
    TarnErrorRef e;
    if (_performSingleParameterQuery(kInvalidate, identifier, &e)) return true;
    if (error) *error = TARN_ERROR(TarnErrorDatabase, e, "failed to invalidate identifier %@", identifier);
    return false;
}

bool TarnSQLiteDB::invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier,
                                                                    TarnErrorRef* error) {
    TarnErrorRef childError;
    std::vector<std::string> identifiers = childIdentifiersForParentIdentifier(identifier, &childError);
    if (identifiers.empty() && childError && childError->code() != TarnErrorDatabaseNotFound) {
        TarnErrorRef e = TARN_ERROR(TarnErrorDatabase, childError,
                                    "Error retrieving child bundles ids from DB with identifier %@ : %@",
                                    identifier, childError);
        if (error) *error = e;
        return false;
    }
    identifiers.insert(identifiers.begin(), identifier);

    TarnErrorRef execError;
    if (!_sqliteExec("BEGIN;", &execError)) {
        TarnErrorRef e = TARN_ERROR(TarnErrorDatabase, execError, "failed _sqliteExec begin");
        if (error) *error = e;
        return false;
    }
    TarnErrorRef e;
    try {
        for (const std::string& child : identifiers) {
            TarnErrorRef invalidateError;
            if (!invalidateCodeSigningWithIdentifier(child, &invalidateError)) {
                TarnLog(kLogError, "invalidateCodeSigningForIdentifierAndAllChildren",
                        "Failed to invalidate code signing info for %@ child %@ : %@", identifier, child,
                        invalidateError);
            } else {
                TarnLog(kLogDebug, "invalidateCodeSigningForIdentifierAndAllChildren",
                        "Invalidating code signing info for %@ child: %@", identifier, child);
            }
        }
        runStoreStepHook("commit");
        e = commitTransaction();
    } catch (const std::exception& ex) {
        e = handleTransactionException("invalidateCodeSigningForIdentifierAndAllChildren", &ex);
    } catch (...) {
        e = handleTransactionException("invalidateCodeSigningForIdentifierAndAllChildren", nullptr);
    }
    if (e && error) *error = e;
    return !e;
}

bool TarnSQLiteDB::_deleteCodeSigningWithIdentifier(const std::string& identifier, TarnErrorRef* error) {
    return _performSingleParameterQuery(kDeleteEntry, identifier, 1, error);
}

bool TarnSQLiteDB::deleteCodeSigningEntryWithIdentifier(const std::string& identifier, TarnErrorRef* error) {
    if (identifier.empty()) {
        TarnErrorRef e = TARN_ERROR(TarnErrorBadInput, nullptr, "identifier %@ cannot be nil", "(null)");
        if (error) *error = e;
        return false;
    }
    TarnErrorRef e;
    if (_deleteCodeSigningWithIdentifier(identifier, &e)) return true;
    if (error) *error = TARN_ERROR(TarnErrorDatabase, e, "failed to delete from code_signing_info");
    return false;
}

bool TarnSQLiteDB::deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(TarnErrorRef* error) {
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
    if (e && error) *error = e;
    return !e;
}

}  // namespace tarn
