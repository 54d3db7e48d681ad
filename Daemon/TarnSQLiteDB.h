// The persistent store of the code-signing mapping: one SQLite database,
// "containers.sqlite3" in the daemon's library directory, holding one entry
// per code-signing identifier plus the identifiers of its child bundles.
//
// Threading: the class has no lock of its own. Every call must come from one
// thread at a time; in the daemon that is the mapping's serial queue. Each
// operation prepares and finalises its own statements, except the entry
// look-up, whose compiled statement is kept and reset after every use.
//
// The database is opened in exclusive locking mode: no other process may use
// the file while this object holds it open. Failing to open or initialise it
// ends the process, because the daemon cannot run without it.
//
// Every operation answers a TarnResult (Daemon/TarnResult.h) whose error is of
// TarnErrorDomain: TarnErrorBadInput a required argument is missing,
// TarnErrorException an unexpected failure inside a transaction,
// TarnErrorDatabase a SQLite call failed or stored data could not be
// (de)serialised, TarnErrorDatabaseNotFound the identifier (or its children or
// parent) is not stored, TarnErrorDatabaseUnexpectedChanges a statement changed
// another number of rows than required, TarnErrorAllocationFailed a result
// could not be allocated.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "Daemon/TarnCodeSigningEntry.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnResult.h"
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
    // Opens `url` read-only (nothing is created or initialised) and runs
    // SQLite's integrity check: the problems it lists, empty when the file is
    // sound. A file that cannot be opened or read as a database is one problem.
    static std::vector<std::string> integrityProblemsAtURL(const FileURL& url);
    // Closes the handle; later calls fail with TarnErrorDatabase. Also done on
    // destruction.
    void closeDB();

    sqlite3* db() const { return db_; }
    const FileURL& url() const { return url_; }

    // Stores or replaces the entry of `withIdentifier` and records its children
    // under it, in one transaction. Child rows the entry no longer lists stay.
    TarnStatus addCodeSigningEntry(const TarnCodeSigningEntryRef& codeSigningEntry,
                                   const std::string& withIdentifier);
    // Deletes exactly one entry; its data and child rows go with it.
    TarnStatus deleteCodeSigningEntryWithIdentifier(const std::string& identifier);
    // The entry with its children (never empty), or TarnErrorDatabaseNotFound
    // when it is not stored.
    TarnResult<TarnCodeSigningEntryRef> codeSigningEntryWithIdentifier(const std::string& identifier);
    // Marks one entry invalid; an unknown identifier is not an error.
    TarnStatus invalidateCodeSigningWithIdentifier(const std::string& identifier);
    // Marks the entry and every child of it invalid, in one transaction.
    TarnStatus invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier);

    using EntryBlock =
        std::function<void(const std::string& identifier, const TarnCodeSigningEntryRef& entry)>;
    // Calls `block` once per readable stored entry, skipping rows that cannot
    // be decoded. Fails with the last error when any row was skipped.
    TarnStatus enumerateIdentifiersAndCodeSigningInfoUsingBlock(const EntryBlock& block);

    // Every stored identifier; empty on an empty database. Fails only when no
    // identifier could be read: a later row's failure leaves a partial set.
    TarnResult<std::set<std::string>> identifiersWithError();
    // The children in row order (never empty), or TarnErrorDatabaseNotFound
    // when there are none.
    TarnResult<std::vector<std::string>> childIdentifiersForParentIdentifier(
        const std::string& identifier);
    // The parent, or TarnErrorDatabaseNotFound when the identifier is nobody's
    // child.
    TarnResult<std::string> parentIdentifierForChildIdentifier(const std::string& identifier);
    // Removes every entry flagged as an advance copy.
    TarnStatus deleteAllAdvanceCopiesOfCodeSigningEntriesWithError();

    // Tests: called at the named steps of a store ("info", "data", "children")
    // and before every commit ("commit"); a hook that throws stands in for an
    // unexpected failure there.
    std::function<void(const char* step)> TEST_storeStepHook;

private:
  // Runs a SELECT: prepares `query`, binds `textInput` (when given) to its one
  // parameter, named `column` in the failure line, and hands each row's
  // statement to `row`. A failed prepare, bind or step is the answer, with
  // its line, under `function`'s name.
  template <class Row>
  TarnStatus _selectRows(const char* function, const char* query, const std::string* textInput,
                         const char* column, Row&& row);
  TarnStatus _sqliteExec(const char* statement);
  TarnStatus _performSingleParameterQuery(const char* query, const std::string& withTextInput);
  TarnStatus _performSingleParameterQuery(const char* query, const std::string& withTextInput,
                                          int expectedChanges);
  // `andTextInputTwo` null: the query takes one parameter. `expectedChanges`
  // -1: the change count is not checked.
  TarnStatus _performTwoParameterQuery(const char* query, const std::string& withTextInputOne,
                                       const std::string* andTextInputTwo, int expectedChanges);
  TarnStatus _insertCodeSigningInfo(const TarnCodeSigningEntry& info,
                                    const std::string& forIdentifier);
  TarnStatus _insertCodeSigningData(const TarnCodeSigningEntry& data,
                                    const std::string& forIdentifier);
  TarnStatus _insertChildIdentifier(const std::string& childIdentifier,
                                    const std::string& forParentIdentifier);
  TarnStatus _performInsertOrUpdateQuery(const char* query,
                                         const TarnCodeSigningEntry& withCodeSigningEntry,
                                         const std::string& forIdentifier, bool isUpdate);
  // Empty without an error when no row matches.
  TarnResult<std::shared_ptr<TarnCodeSigningEntry>> _selectCodeSigningEntryWithIdentifier(
      const std::string& identifier);
  TarnResult<std::shared_ptr<TarnCodeSigningEntry>> _codeSigningEntryFromStatementRow(
      sqlite3_stmt* statement);
  TarnStatus _deleteCodeSigningWithIdentifier(const std::string& identifier);

  // BEGIN, `body` (returning TarnStatus), then COMMIT; a failed body is
  // rolled back and its error answered. The body and the commit are an
  // exception boundary, because they run as items of the mapping's queue:
  // what they throw is TarnErrorException (the fatal report on internal
  // builds) after a rollback of whatever is still open. `operation` names the
  // caller in the log lines of a failed BEGIN and of a caught exception.
  template <class Body>
  TarnStatus inTransaction(const char* operation, Body&& body);
  // Rolls back after `cause`; the rollback's own failure wraps `cause`.
  TarnErrorRef rollbackAfter(TarnErrorRef cause);
  // COMMIT; on failure rolls back whatever is still open.
  TarnStatus commitTransaction();
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
