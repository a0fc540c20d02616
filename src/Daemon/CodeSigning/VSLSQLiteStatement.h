// One prepared statement of the code-signing database, finalised when it goes out
// of scope (every statement is prepared, bound, stepped and finalised per call).
#pragma once

#include <sqlite3.h>

#include <string>

#include "Daemon/Core/VSLError.h"

namespace vsl {

class VSLSQLiteStatement {
public:
    // `path` names the database file in messages.
    VSLSQLiteStatement(sqlite3* db, const std::string& path) : db_(db), path_(path) {}
    ~VSLSQLiteStatement();
    VSLSQLiteStatement(const VSLSQLiteStatement&) = delete;
    VSLSQLiteStatement& operator=(const VSLSQLiteStatement&) = delete;

    // `kind` ("insert", "select", "delete") names the statement in the failure message.
    bool prepare(const char* sql, const char* kind, VSLErrorRef* error);

    // Text is bound up to its end and copied by SQLite. `failureFormat` takes the
    // text, the database path and SQLite's message.
    bool bindText(int index, const std::string& text, const char* failureFormat, VSLErrorRef* error);

    // SQLITE_ROW, SQLITE_DONE or an error result.
    int step();
    // Steps once and expects SQLITE_DONE; otherwise a code-66 step error.
    bool stepToDone(VSLErrorRef* error);
    // The code-66 error for a failed step.
    VSLErrorRef stepError() const;

    sqlite3_stmt* get() const { return stmt_; }
    sqlite3* db() const { return db_; }
    const std::string& path() const { return path_; }
    const char* sql() const { return sql_; }

private:
    sqlite3* db_;
    const std::string& path_;
    sqlite3_stmt* stmt_ = nullptr;
    const char* sql_ = "";
};

}  // namespace vsl
