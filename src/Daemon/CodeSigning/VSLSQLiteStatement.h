// One use of a statement of the code-signing database: prepared (or taken from the
// connection's cache of prepared statements), bound, stepped, and reset with its
// bindings cleared when it goes out of scope.
#pragma once

#include <sqlite3.h>

#include <string>
#include <unordered_map>

#include "Daemon/Core/VSLError.h"

namespace vsl {

// Hands `error` out (when asked for) and answers false: every failure here.
inline bool failWithError(VSLErrorRef* out, VSLErrorRef error) {
    if (out) *out = std::move(error);
    return false;
}

// Prepared statements of one connection, keyed by their text. Preparing is most of
// the cost of a one-row query, and the daemon asks for the caller's entry on every
// message.
class VSLSQLiteStatementCache {
public:
    VSLSQLiteStatementCache(sqlite3* db, const std::string& path) : db_(db), path_(path) {}
    ~VSLSQLiteStatementCache() { finalizeAll(); }
    VSLSQLiteStatementCache(const VSLSQLiteStatementCache&) = delete;
    VSLSQLiteStatementCache& operator=(const VSLSQLiteStatementCache&) = delete;
    // Before the connection closes.
    void finalizeAll();

private:
    friend class VSLSQLiteStatement;
    struct Slot {
        sqlite3_stmt* statement = nullptr;
        bool inUse = false;
    };
    sqlite3* db_;
    const std::string& path_;
    std::unordered_map<std::string, Slot> slots_;
};

class VSLSQLiteStatement {
public:
    explicit VSLSQLiteStatement(VSLSQLiteStatementCache& cache) : cache_(cache) {}
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

private:
    VSLSQLiteStatementCache& cache_;
    sqlite3_stmt* stmt_ = nullptr;
    VSLSQLiteStatementCache::Slot* slot_ = nullptr;  // none: prepared for this use only
};

}  // namespace vsl
