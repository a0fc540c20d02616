#include "Daemon/CodeSigning/VSLSQLiteStatement.h"

namespace vsl {

namespace {

void finalize(sqlite3* db, sqlite3_stmt* statement, const std::string& path) {
    if (sqlite3_finalize(statement) != SQLITE_OK)
        LogWrite(kLogLevelError, "VSLSQLiteStatement", "sqlite3_finalize for %@ failed: %s", path, sqlite3_errmsg(db));
}

}  // namespace

void VSLSQLiteStatementCache::finalizeAll() {
    for (auto& [sql, slot] : slots_) finalize(db_, slot.statement, path_);
    slots_.clear();
}

VSLSQLiteStatement::~VSLSQLiteStatement() {
    if (!stmt_) return;
    if (!slot_) {
        finalize(cache_.db_, stmt_, cache_.path_);
        return;
    }
    sqlite3_reset(stmt_);
    sqlite3_clear_bindings(stmt_);
    slot_->inUse = false;
}

bool VSLSQLiteStatement::prepare(const char* sql, const char* kind, VSLErrorRef* error) {
    auto found = cache_.slots_.find(sql);
    if (found != cache_.slots_.end() && !found->second.inUse) {
        slot_ = &found->second;
        slot_->inUse = true;
        stmt_ = slot_->statement;
        return true;
    }
    if (sqlite3_prepare_v3(cache_.db_, sql, -1, SQLITE_PREPARE_PERSISTENT, &stmt_, nullptr) == SQLITE_OK) {
        // A statement already in use (a nested query of the same text) gets one of its own.
        if (found == cache_.slots_.end()) {
            slot_ = &cache_.slots_[sql];
            slot_->statement = stmt_;
            slot_->inUse = true;
        }
        return true;
    }
    std::string k = kind;
    const std::string& path = cache_.path_;
    const char* message = sqlite3_errmsg(cache_.db_);
    auto e =
        k == "select"
            ? VSL_ERROR(kVSLErrorDatabase, nullptr, true, "sqlite3_prepare(select) for %@ failed: %s", path, message)
        : k == "delete"
            ? VSL_ERROR(kVSLErrorDatabase, nullptr, true, "sqlite3_prepare(delete) for %@ failed: %s", path, message)
            : VSL_ERROR(kVSLErrorDatabase, nullptr, true, "sqlite3_prepare(insert) for %@ failed: %s", path, message);
    if (error) *error = e;
    return false;
}

bool VSLSQLiteStatement::bindText(int index, const std::string& text, const char* failureFormat, VSLErrorRef* error) {
    if (sqlite3_bind_text(stmt_, index, text.c_str(), -1, SQLITE_TRANSIENT) == SQLITE_OK) return true;
    auto e = VSL_ERROR(kVSLErrorDatabase, nullptr, true, failureFormat, text, cache_.path_, sqlite3_errmsg(cache_.db_));
    if (error) *error = e;
    return false;
}

int VSLSQLiteStatement::step() {
    return sqlite3_step(stmt_);
}

VSLErrorRef VSLSQLiteStatement::stepError() const {
    return VSL_ERROR(kVSLErrorDatabase, nullptr, true, "sqlite3_step for %@ failed: %s", cache_.path_,
                     sqlite3_errmsg(cache_.db_));
}

bool VSLSQLiteStatement::stepToDone(VSLErrorRef* error) {
    if (step() == SQLITE_DONE) return true;
    auto e = stepError();
    if (error) *error = e;
    return false;
}

}  // namespace vsl
