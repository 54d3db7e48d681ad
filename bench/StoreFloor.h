// The floor of the code-signing benches: bare SQLite doing what the store
// does, on a database opened with the same initialisation (so the same WAL
// mode, locking mode and fsync behaviour). The text is repeated here so that
// the floor does not depend on the code under measurement.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <vector>

namespace tarn::bench {

inline constexpr const char* kStoreInit =
    "PRAGMA locking_mode = EXCLUSIVE;PRAGMA journal_mode = WAL;PRAGMA foreign_keys = ON;PRAGMA "
    "auto_vacuum = FULL;"
    "CREATE TABLE IF NOT EXISTS code_signing_info(id INTEGER PRIMARY KEY AUTOINCREMENT,"
    "code_signing_id_text TEXT NOT NULL UNIQUE,invalid INTEGER NOT NULL DEFAULT 0,placeholder "
    "INTEGER NOT NULL DEFAULT 0,registered_by_caller INTEGER NOT NULL DEFAULT "
    "0,data_container_class INTEGER NOT NULL DEFAULT 0);"
    "CREATE TABLE IF NOT EXISTS code_signing_data(id INTEGER PRIMARY KEY AUTOINCREMENT,cs_info_id "
    "INTEGER NOT NULL UNIQUE,data BLOB NOT NULL,FOREIGN KEY(cs_info_id) REFERENCES "
    "code_signing_info(id) ON DELETE CASCADE);"
    "CREATE TABLE IF NOT EXISTS child_bundles(id INTEGER PRIMARY KEY AUTOINCREMENT,"
    "child_code_signing_id_text TEXT NOT NULL UNIQUE,parent_id INTEGER NOT NULL,FOREIGN "
    "KEY(parent_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);"
    "CREATE INDEX IF NOT EXISTS code_signing_id_text_idx ON "
    "code_signing_info(code_signing_id_text);"
    "CREATE INDEX IF NOT EXISTS cs_info_id_idx ON code_signing_data(cs_info_id);"
    "CREATE INDEX IF NOT EXISTS parent_id_idx ON child_bundles(parent_id);";

class BareStore {
  public:
    explicit BareStore(const std::string& path) {
        check(sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE,
                              nullptr),
              SQLITE_OK, "open");
        exec(kStoreInit);
    }
    ~BareStore() { sqlite3_close(db_); }
    BareStore(const BareStore&) = delete;
    BareStore& operator=(const BareStore&) = delete;

    void exec(const char* sql) {
        check(sqlite3_exec(db_, sql, nullptr, nullptr, nullptr), SQLITE_OK, sql);
    }

    // One prepared statement per use, as the store does.
    void runStep(const char* sql, const std::function<void(sqlite3_stmt*)>& bind,
                 bool wantRow = false, const std::function<void(sqlite3_stmt*)>& row = nullptr) {
        sqlite3_stmt* st = nullptr;
        check(sqlite3_prepare_v2(db_, sql, -1, &st, nullptr), SQLITE_OK, sql);
        bind(st);
        while (sqlite3_step(st) == SQLITE_ROW) {
            if (row) row(st);
            if (!wantRow) break;
        }
        sqlite3_finalize(st);
    }

    // The store's upsert of one entry: flags updated or inserted, then the
    // info blob, in one transaction.
    void upsert(const std::string& id, const std::vector<uint8_t>& blob, int64_t dataClass) {
        auto bindFlags = [&](sqlite3_stmt* st) {
            sqlite3_bind_int(st, 1, 0);
            sqlite3_bind_int(st, 2, 0);
            sqlite3_bind_int(st, 3, 0);
            sqlite3_bind_int64(st, 4, dataClass);
            sqlite3_bind_text(st, 5, id.c_str(), -1, SQLITE_TRANSIENT);
        };
        exec("BEGIN;");
        runStep(
            "UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, "
            "data_container_class=? WHERE code_signing_id_text=?;",
            bindFlags);
        if (sqlite3_changes(db_) != 1) {
            runStep(
                "INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, "
                "data_container_class, code_signing_id_text) VALUES (?, ?, ?, ?, ?);",
                bindFlags);
        }
        runStep(
            "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM "
            "code_signing_info WHERE code_signing_id_text = ?;",
            [&](sqlite3_stmt* st) {
                sqlite3_bind_blob64(st, 1, blob.data(), blob.size(), SQLITE_STATIC);
                sqlite3_bind_text(st, 2, id.c_str(), -1, SQLITE_TRANSIENT);
            });
        exec("COMMIT;");
    }

  private:
    void check(int rc, int want, const char* what) {
        if (rc == want) return;
        std::fprintf(stderr, "%s: %s\n", what, sqlite3_errmsg(db_));
        std::exit(1);
    }

    sqlite3* db_ = nullptr;
};

}  // namespace tarn::bench
