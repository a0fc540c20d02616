#include "Daemon/CodeSigning/VSLSQLiteStatement.h"

namespace vsl {

VSLSQLiteStatement::~VSLSQLiteStatement() {
    if (!stmt_) return;
    if (sqlite3_finalize(stmt_) != SQLITE_OK)
        LogWrite(kLogLevelError, "VSLSQLiteStatement", "sqlite3_finalize for %@ failed: %s", path_,
                 sqlite3_errmsg(db_));
}

bool VSLSQLiteStatement::prepare(const char* sql, const char* kind, VSLErrorRef* error) {
    sql_ = sql;
    if (sqlite3_prepare_v2(db_, sql, -1, &stmt_, nullptr) == SQLITE_OK) return true;
    auto e = std::string(kind) == "select"
                 ? VSL_ERROR(kVSLErrorDatabase, nullptr, true, "sqlite3_prepare(select) for %@ failed: %s", path_,
                             sqlite3_errmsg(db_))
             : std::string(kind) == "delete"
                 ? VSL_ERROR(kVSLErrorDatabase, nullptr, true, "sqlite3_prepare(delete) for %@ failed: %s", path_,
                             sqlite3_errmsg(db_))
                 : VSL_ERROR(kVSLErrorDatabase, nullptr, true, "sqlite3_prepare(insert) for %@ failed: %s", path_,
                             sqlite3_errmsg(db_));
    if (error) *error = e;
    return false;
}

bool VSLSQLiteStatement::bindText(int index, const std::string& text, const char* failureFormat,
                                  VSLErrorRef* error) {
    if (sqlite3_bind_text(stmt_, index, text.c_str(), -1, SQLITE_TRANSIENT) == SQLITE_OK) return true;
    auto e = VSL_ERROR(kVSLErrorDatabase, nullptr, true, failureFormat, text, path_, sqlite3_errmsg(db_));
    if (error) *error = e;
    return false;
}

int VSLSQLiteStatement::step() { return sqlite3_step(stmt_); }

VSLErrorRef VSLSQLiteStatement::stepError() const {
    return VSL_ERROR(kVSLErrorDatabase, nullptr, true, "sqlite3_step for %@ failed: %s", path_, sqlite3_errmsg(db_));
}

bool VSLSQLiteStatement::stepToDone(VSLErrorRef* error) {
    if (step() == SQLITE_DONE) return true;
    auto e = stepError();
    if (error) *error = e;
    return false;
}

}  // namespace vsl
