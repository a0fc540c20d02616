#include "Daemon/CodeSigning/VSLSQLiteTransaction.h"

#include <sqlite3.h>

namespace vsl {

bool sqliteExec(sqlite3* db, const std::string& path, const char* sql, VSLErrorRef* error) {
    char* message = nullptr;
    if (sqlite3_exec(db, sql, nullptr, nullptr, &message) == SQLITE_OK) return true;
    auto e = VSL_ERROR(kVSLErrorDatabase, nullptr, true, "%@ on %@ failed: %s", sql, path, message ? message : "");
    sqlite3_free(message);
    if (error) *error = std::move(e);
    return false;
}

VSLSQLiteTransaction::~VSLSQLiteTransaction() {
    if (open_) rollback(nullptr);
}

bool VSLSQLiteTransaction::begin(VSLErrorRef* error) {
    VSLErrorRef underlying;
    if (sqliteExec(db_, path_, "BEGIN;", &underlying)) {
        open_ = true;
        return true;
    }
    auto e = createVSLError(function_, __LINE__, kVSLErrorDatabase, underlying, true, "failed _sqliteExec begin");
    if (error) *error = std::move(e);
    return false;
}

bool VSLSQLiteTransaction::commit(VSLErrorRef* error) {
    VSLErrorRef underlying;
    if (sqliteExec(db_, path_, "COMMIT;", &underlying)) {
        open_ = false;
        return true;
    }
    auto e = createVSLError(function_, __LINE__, kVSLErrorDatabase, underlying, true, "failed _sqliteExec commit");
    // SQLite ends the transaction itself on some failures; roll back only what is open.
    if (sqlite3_get_autocommit(db_))
        open_ = false;
    else
        rollback(nullptr);
    if (error) *error = std::move(e);
    return false;
}

bool VSLSQLiteTransaction::rollback(VSLErrorRef* error) {
    if (!open_) return true;
    open_ = false;
    VSLErrorRef underlying;
    if (sqliteExec(db_, path_, "ROLLBACK;", &underlying)) return true;
    auto e = createVSLError(function_, __LINE__, kVSLErrorDatabase, underlying, true, "failed _sqliteExec rollback");
    if (error) *error = std::move(e);
    return false;
}

}  // namespace vsl
