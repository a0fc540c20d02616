// A scoped transaction of the code-signing database: BEGIN when begun; COMMIT when
// asked; ROLLBACK on every other way out, and after a COMMIT that failed. A failed
// COMMIT (a deferred constraint, a busy file) leaves SQLite inside the transaction,
// where every later BEGIN of the connection would fail.
#pragma once

#include <string>

#include "Daemon/Core/VSLError.h"

struct sqlite3;

namespace vsl {

// Runs one statement batch; a failure is a code-66 error "%@ on %@ failed: %s".
bool sqliteExec(sqlite3* db, const std::string& path, const char* sql, VSLErrorRef* error);

class VSLSQLiteTransaction {
public:
    // `function` names the caller in the errors made here.
    VSLSQLiteTransaction(sqlite3* db, const std::string& path, const char* function)
        : db_(db), path_(path), function_(function) {}
    // Rolls back a transaction that was begun and neither committed nor rolled back.
    ~VSLSQLiteTransaction();
    VSLSQLiteTransaction(const VSLSQLiteTransaction&) = delete;
    VSLSQLiteTransaction& operator=(const VSLSQLiteTransaction&) = delete;

    // Failure: code 66 "failed _sqliteExec begin".
    bool begin(VSLErrorRef* error);
    // Failure: code 66 "failed _sqliteExec commit", after rolling back what is still open.
    bool commit(VSLErrorRef* error);
    // Nothing to do unless begun and still open. Failure: code 66 "failed _sqliteExec rollback".
    bool rollback(VSLErrorRef* error);

private:
    sqlite3* db_;
    const std::string& path_;
    const char* function_;
    bool open_ = false;
};

}  // namespace vsl
