// The persistent store of the code-signing mapping: one SQLite database,
// "containers.sqlite3" in the daemon's library directory, holding one entry
// per code-signing identifier plus the identifiers of its child bundles.
//
// Threading: the class has no lock of its own. Every call must come from one
// thread at a time; in the daemon that is the mapping's serial queue. Each
// operation prepares and finalises its own statements, so nothing is shared
// between calls.
//
// The database is opened in exclusive locking mode: no other process may use
// the file while this object holds it open. Failing to open or initialise it
// ends the process, because the daemon cannot run without it.
//
// Errors come back as TarnErrorRef values of TarnErrorDomain: 38 a required
// argument is missing, 40 an unexpected failure inside a transaction, 66 a
// SQLite call failed or stored data could not be (de)serialised, 67 the
// identifier (or its children or parent) is not stored, 68 a statement
// changed another number of rows than required, 73 a result could not be
// allocated.
#pragma once

#include <cstdint>
#include <functional>
#include <exception>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "Daemon/TarnCodeSigningEntry.h"
#include "Daemon/TarnError.h"
#include "Platform/Path.h"

struct sqlite3;
struct sqlite3_stmt;

namespace tarn {

class TarnSQLiteDB {
public:
    // Opens or creates `databaseURL` (a full file path).
    explicit TarnSQLiteDB(FileURL databaseURL);
    // initWithParentDirectoryURL: the store "containers.sqlite3" in `parentDirectory`;
    // empty when no file URL can be built from it.
    static std::unique_ptr<TarnSQLiteDB> initWithParentDirectoryURL(const FileURL& parentDirectory);
    ~TarnSQLiteDB();
    TarnSQLiteDB(const TarnSQLiteDB&) = delete;
    TarnSQLiteDB& operator=(const TarnSQLiteDB&) = delete;

    // Opens and initialises the database at `url`; never returns on failure.
    static sqlite3* openDBWithURL(const FileURL& url);
    // Closes the handle; later calls fail with 66. Also done on destruction.
    void closeDB();

    sqlite3* db() const { return db_; }
    const FileURL& url() const { return url_; }

    // Stores or replaces the entry of `withIdentifier` and records its children
    // under it, in one transaction. Child rows the entry no longer lists stay.
    bool addCodeSigningEntry(const TarnCodeSigningEntryRef& codeSigningEntry,
                             const std::string& withIdentifier, TarnErrorRef* error);
    // Deletes exactly one entry; its data and child rows go with it.
    bool deleteCodeSigningEntryWithIdentifier(const std::string& identifier, TarnErrorRef* error);
    // The entry with its children, or empty (67 when it is not stored).
    TarnCodeSigningEntryRef codeSigningEntryWithIdentifier(const std::string& identifier,
                                                           TarnErrorRef* error);
    // Marks one entry invalid; an unknown identifier is not an error.
    bool invalidateCodeSigningWithIdentifier(const std::string& identifier, TarnErrorRef* error);
    // Marks the entry and every child of it invalid, in one transaction.
    bool invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier,
                                                          TarnErrorRef* error);

    using EntryBlock =
        std::function<void(const std::string& identifier, const TarnCodeSigningEntryRef& entry)>;
    // Calls `block` once per readable stored entry, skipping rows that cannot
    // be decoded. Returns empty when every row was handled, else the last error.
    TarnErrorRef enumerateIdentifiersAndCodeSigningInfoUsingBlock(const EntryBlock& block);

    // Every stored identifier. Empty on an empty database (without an error)
    // and on failure (with one); a partial set is returned when a later row failed.
    std::set<std::string> identifiersWithError(TarnErrorRef* error);
    // The children in row order; empty with 67 when there are none.
    std::vector<std::string> childIdentifiersForParentIdentifier(const std::string& identifier,
                                                                TarnErrorRef* error);
    // The parent, or empty with 67 when the identifier is nobody's child.
    std::string parentIdentifierForChildIdentifier(const std::string& identifier,
                                                   TarnErrorRef* error);
    // Removes every entry flagged as an advance copy.
    bool deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(TarnErrorRef* error);

    // Tests: called at the named steps of a store ("info", "data", "children",
    // "commit"); a hook that throws stands in for an unexpected failure there.
    std::function<void(const char* step)> TEST_storeStepHook;

private:
    bool _sqliteExec(const char* statement, TarnErrorRef* error);
    bool _performSingleParameterQuery(const char* query, const std::string& withTextInput,
                                      TarnErrorRef* error);
    bool _performSingleParameterQuery(const char* query, const std::string& withTextInput,
                                      int expectedChanges, TarnErrorRef* error);
    // `andTextInputTwo` null: the query takes one parameter. `expectedChanges`
    // -1: the change count is not checked.
    bool _performTwoParameterQuery(const char* query, const std::string& withTextInputOne,
                                   const std::string* andTextInputTwo, int expectedChanges,
                                   TarnErrorRef* error);
    bool _insertCodeSigningInfo(const TarnCodeSigningEntry& info, const std::string& forIdentifier,
                                TarnErrorRef* error);
    bool _insertCodeSigningData(const TarnCodeSigningEntry& data, const std::string& forIdentifier,
                                TarnErrorRef* error);
    bool _insertChildIdentifier(const std::string& childIdentifier,
                                const std::string& forParentIdentifier, TarnErrorRef* error);
    bool _performInsertOrUpdateQuery(const char* query, const TarnCodeSigningEntry& withCodeSigningEntry,
                                     const std::string& forIdentifier, bool isUpdate,
                                     TarnErrorRef* error);
    std::shared_ptr<TarnCodeSigningEntry> _selectCodeSigningEntryWithIdentifier(
        const std::string& identifier, TarnErrorRef* error);
    std::shared_ptr<TarnCodeSigningEntry> _codeSigningEntryFromStatementRow(sqlite3_stmt* statement,
                                                                            TarnErrorRef* error);
    bool _deleteCodeSigningWithIdentifier(const std::string& identifier, TarnErrorRef* error);

    // Rolls back after `cause`; the rollback's own failure wraps `cause`.
    TarnErrorRef rollbackAfter(TarnErrorRef cause);
    // COMMIT; on failure rolls back whatever is still open. Null on success.
    TarnErrorRef commitTransaction();
    // Turns an exception caught inside a transaction into error 40 (after a
    // rollback); on an internal build the process stops instead.
    // A caught exception in `operation`: rolled back, 40 (the fatal report on internal builds).
    TarnErrorRef handleTransactionException(const char* operation, const std::exception* exception);
    void finalize(sqlite3_stmt* statement);
    const char* errmsg() const;
    void runStoreStepHook(const char* step);

    // Constant after construction.
    const FileURL url_;
    // Cleared by closeDB().
    sqlite3* db_ = nullptr;
    // The compiled entry look-up, made on first use; finalized by closeDB().
    sqlite3_stmt* selectEntry_ = nullptr;
};

}  // namespace tarn
