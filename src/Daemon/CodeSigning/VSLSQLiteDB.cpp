#include "Daemon/CodeSigning/VSLSQLiteDB.h"

#include <sqlite3.h>

#include <mutex>

#include "Daemon/CodeSigning/VSLSQLiteStatement.h"
#include "Daemon/CodeSigning/VSLSQLiteTransaction.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Core/VSLInjectedFaults.h"
#include "Daemon/Core/VSLInvariant.h"
#include "Platform/Log.h"
#include "Platform/PropertyList.h"

namespace vsl {

const char* const kVSLCodeSigningDatabaseFileName = "containers.sqlite3";

namespace {

// Auto-vacuum comes first: it only takes on a file that has no page yet, and the
// switch to the write-ahead journal writes the first one.
const char* const kSchema =
    "PRAGMA auto_vacuum = FULL;"
    "PRAGMA locking_mode = EXCLUSIVE;"
    "PRAGMA journal_mode = WAL;"
    "PRAGMA foreign_keys = ON;"
    "CREATE TABLE IF NOT EXISTS code_signing_info ("
    "id INTEGER PRIMARY KEY AUTOINCREMENT, "
    "code_signing_id_text TEXT NOT NULL UNIQUE, "
    "invalid INTEGER NOT NULL DEFAULT 0, "
    "placeholder INTEGER NOT NULL DEFAULT 0, "
    "registered_by_caller INTEGER NOT NULL DEFAULT 0, "
    "data_container_class INTEGER NOT NULL DEFAULT 0);"
    "CREATE TABLE IF NOT EXISTS code_signing_data ("
    "id INTEGER PRIMARY KEY AUTOINCREMENT, "
    "cs_info_id INTEGER NOT NULL UNIQUE, "
    "data BLOB NOT NULL, "
    "FOREIGN KEY (cs_info_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);"
    "CREATE TABLE IF NOT EXISTS child_bundles ("
    "id INTEGER PRIMARY KEY AUTOINCREMENT, "
    "child_code_signing_id_text TEXT NOT NULL UNIQUE, "
    "parent_id INTEGER NOT NULL, "
    "FOREIGN KEY (parent_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);"
    "CREATE INDEX IF NOT EXISTS code_signing_id_text_idx ON code_signing_info(code_signing_id_text);"
    "CREATE INDEX IF NOT EXISTS cs_info_id_idx ON code_signing_data(cs_info_id);"
    "CREATE INDEX IF NOT EXISTS parent_id_idx ON child_bundles(parent_id);";

const char* const kUpdateInfo =
    "UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, data_container_class=? WHERE "
    "code_signing_id_text=?;";
const char* const kInsertInfo =
    "INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, data_container_class, "
    "code_signing_id_text) VALUES (?, ?, ?, ?, ?);";
const char* const kInsertData =
    "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM code_signing_info WHERE "
    "code_signing_id_text = ?;";
const char* const kInsertChild =
    "INSERT OR REPLACE INTO child_bundles (parent_id, child_code_signing_id_text) SELECT id, ? FROM "
    "code_signing_info WHERE code_signing_id_text = ?;";
const char* const kDelete = "DELETE FROM code_signing_info WHERE code_signing_id_text=?;";
const char* const kInvalidate = "UPDATE code_signing_info SET invalid=1 WHERE code_signing_id_text = ?;";
const char* const kDeleteAdvanceCopies = "DELETE FROM code_signing_info WHERE (placeholder & ?) > 0;";

}  // namespace

// ---- life cycle ----

std::unique_ptr<VSLSQLiteDB> VSLSQLiteDB::initWithParentDirectoryURL(const std::string& parentDirectoryURL) {
    if (parentDirectoryURL.empty()) return nullptr;
    std::string url = parentDirectoryURL;
    if (url.back() != '/') url += '/';
    url += kVSLCodeSigningDatabaseFileName;
    sqlite3* db = openDBWithURL(url);
    return std::make_unique<VSLSQLiteDB>(Passkey{}, db, std::move(url));
}

sqlite3* VSLSQLiteDB::openDBWithURL(const std::string& url) {
    // Memory statistics put a process-wide mutex around every allocation, and every
    // statement is prepared afresh; nothing here reads the statistics. Only takes
    // effect before SQLite's first use.
    static std::once_flag configureOnce;
    std::call_once(configureOnce, [] { sqlite3_config(SQLITE_CONFIG_MEMSTATUS, 0); });
    sqlite3* db = nullptr;
    int rc = sqlite3_open_v2(url.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
    if (rc != SQLITE_OK) {
        LogWrite(kLogLevelError, "openDBWithURL", "opening %@ failed: %s", url,
                 db ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
        sqlite3_close(db);
        LogWrite(kLogLevelError, "openDBWithURL",
                 "The code-signing database %@ cannot be used. Move it aside and restart vesseld; it starts with an "
                 "empty database that installers fill again.",
                 url);
        VSLFatalError("openDBWithURL", formatLog("Failed to open database, err = %d", rc));
    }
    char* message = nullptr;
    rc = sqlite3_exec(db, kSchema, nullptr, nullptr, &message);
    if (rc != SQLITE_OK) {
        LogWrite(kLogLevelError, "openDBWithURL", "table create for %@ failed: %s", url, message ? message : "");
        sqlite3_free(message);
        sqlite3_close(db);
        LogWrite(kLogLevelError, "openDBWithURL",
                 "The code-signing database %@ cannot be used. Move it aside and restart vesseld; it starts with an "
                 "empty database that installers fill again.",
                 url);
        VSLFatalError("openDBWithURL", formatLog("Failed to initialize database, err = %d", rc));
    }
    osLog(LogCategory::Database, OSLogLevel::Debug, "opening %@", url);
    return db;
}

VSLSQLiteDB::VSLSQLiteDB(Passkey, sqlite3* db, std::string url)
    : db_(db), url_(std::move(url)), statements_(std::make_unique<VSLSQLiteStatementCache>(db_, url_)) {}

VSLSQLiteDB::~VSLSQLiteDB() {
    closeDB();
}

void VSLSQLiteDB::closeDB() {
    if (!db_) return;
    generation_.fetch_add(1, std::memory_order_acq_rel);
    osLog(LogCategory::Database, OSLogLevel::Debug, "closing %@", url_);
    statements_->finalizeAll();
    int rc = sqlite3_close(db_);
    if (rc != SQLITE_OK) LogWrite(kLogLevelError, "closeDB", "sqlite3_close for %@ failed: %d", url_, rc);
    db_ = nullptr;
}

bool VSLSQLiteDB::_sqliteExec(const char* sql, VSLErrorRef* error) { return sqliteExec(db_, url_, sql, error); }

// ---- writing ----

bool VSLSQLiteDB::_performInsertOrUpdateQuery(const char* sql, const VSLCodeSigningEntry& entry,
                                              const std::string& identifier, bool isUpdate, VSLErrorRef* error) {
    VSLSQLiteStatement statement(*statements_);
    if (!statement.prepare(sql, "insert", error)) return false;
    sqlite3_stmt* s = statement.get();
    int invalid = entry.invalid ? 1 : 0;
    int placeholder = entry.placeholder ? 1 : 0;
    int advanceCopy = entry.advanceCopy ? 1 : 0;
    int flags = (entry.placeholder ? kFlagPlaceholder : 0) | (entry.advanceCopy ? kFlagAdvanceCopy : 0);
    int registeredByCaller = entry.registeredByCaller ? 1 : 0;
    if (sqlite3_bind_int(s, 1, invalid) != SQLITE_OK)
        return failWithError(
            error, VSL_ERROR(kVSLErrorDatabase, nullptr, true, "sqlite3_bind_int for invalid=%d at %@ failed: %s",
                             invalid, url_, sqlite3_errmsg(db_)));
    if (sqlite3_bind_int(s, 2, flags) != SQLITE_OK)
        return failWithError(
            error, VSL_ERROR(kVSLErrorDatabase, nullptr, true,
                             "sqlite3_bind_int for placeholder=%d, advance_copy=%d (flags=%d) at %@ failed: %s",
                             placeholder, advanceCopy, flags, url_, sqlite3_errmsg(db_)));
    if (sqlite3_bind_int(s, 3, registeredByCaller) != SQLITE_OK)
        return failWithError(error, VSL_ERROR(kVSLErrorDatabase, nullptr, true,
                                              "sqlite3_bind_int for registered_by_caller=%d at %@ failed: %s",
                                              registeredByCaller, url_, sqlite3_errmsg(db_)));
    if (sqlite3_bind_int(s, 4, static_cast<int>(entry.dataContainerClass)) != SQLITE_OK)
        return failWithError(error, VSL_ERROR(kVSLErrorDatabase, nullptr, true,
                                              "sqlite3_bind_int for data_container_class=%llu at %@ failed: %s",
                                              entry.dataContainerClass, url_, sqlite3_errmsg(db_)));
    if (!statement.bindText(5, identifier, "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s", error))
        return false;
    if (!statement.stepToDone(error)) return false;
    if (isUpdate) {
        int changes = sqlite3_changes(db_);
        if (changes != 1)
            return failWithError(error,
                                 VSL_ERROR(kVSLErrorDatabaseChanges, nullptr, false,
                                           "sqlite3_changes for %s in %@: %d, but expecting 1", sql, url_, changes));
    }
    return true;
}

bool VSLSQLiteDB::_insertCodeSigningInfo(const VSLCodeSigningEntry& entry, const std::string& identifier,
                                         VSLErrorRef* error) {
    VSLErrorRef updateError;
    if (_performInsertOrUpdateQuery(kUpdateInfo, entry, identifier, true, &updateError)) return true;
    if (!errorHasCode(updateError, kVSLErrorDatabaseChanges))
        return failWithError(error, VSL_ERROR(kVSLErrorDatabase, updateError, true,
                                              "Error performing UPDATE operation for %@", identifier));
    VSLErrorRef insertError;
    if (_performInsertOrUpdateQuery(kInsertInfo, entry, identifier, false, &insertError)) return true;
    return failWithError(
        error, VSL_ERROR(kVSLErrorDatabase, insertError, true, "Error performing INSERT operation for %@", identifier));
}

bool VSLSQLiteDB::_insertCodeSigningData(const VSLCodeSigningEntry& entry, const std::string& identifier,
                                         VSLErrorRef* error) {
    std::string why = "no code signing info";
    std::optional<std::string> blob;
    if (entry.codeSigningInfo) blob = encodeBinaryPropertyList(*entry.codeSigningInfo, &why);
    if (!blob)
        return failWithError(error, VSL_ERROR(kVSLErrorDatabase, nullptr, true,
                                              "Error creating data from code signing info: %@", why));
    VSLSQLiteStatement statement(*statements_);
    if (!statement.prepare(kInsertData, "insert", error)) return false;
    if (sqlite3_bind_blob64(statement.get(), 1, blob->data(), blob->size(), SQLITE_STATIC) != SQLITE_OK)
        return failWithError(error, VSL_ERROR(kVSLErrorDatabase, nullptr, true,
                                              "sqlite3_bind_blob64 for codeSigningInfoData at %@ failed: %s", url_,
                                              sqlite3_errmsg(db_)));
    if (!statement.bindText(2, identifier, "sqlite3_bind_text for code_signing_id=%@ at %@ failed: %s", error))
        return false;
    return statement.stepToDone(error);
}

bool VSLSQLiteDB::_performTwoParameterQuery(const char* sql, const char* kind, const std::string& textOne,
                                            const char* textOneFailureFormat, const std::string* textTwo,
                                            int expectedChanges, VSLErrorRef* error) {
    VSLSQLiteStatement statement(*statements_);
    if (!statement.prepare(sql, kind, error)) return false;
    if (!statement.bindText(1, textOne, textOneFailureFormat, error)) return false;
    if (textTwo &&
        !statement.bindText(2, *textTwo, "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s", error))
        return false;
    if (!statement.stepToDone(error)) return false;
    if (expectedChanges != -1) {
        int changes = sqlite3_changes(db_);
        if (changes != expectedChanges)
            return failWithError(error, VSL_ERROR(kVSLErrorDatabaseChanges, nullptr, false,
                                                  "sqlite3_changes for %s in %@: %d, but expecting %d", sql, url_,
                                                  changes, expectedChanges));
    }
    return true;
}

bool VSLSQLiteDB::addCodeSigningEntry(const VSLCodeSigningEntry* entry, const std::optional<std::string>& identifier,
                                      VSLErrorRef* error) {
    generation_.fetch_add(1, std::memory_order_acq_rel);
    if (!entry || !identifier)
        return failWithError(error,
                             VSL_ERROR(kVSLErrorInvalidArgument, nullptr, true,
                                       "codeSigningEntry %@ and identifier %@ cannot be nil", entry, identifier));
    if (databaseWriteFailureInjectedFor(*identifier))
        return failWithError(error, VSL_ERROR(kVSLErrorDatabase, nullptr, true, "Injected write failure for %@",
                                              *identifier));
    VSLSQLiteTransaction transaction(db_, url_, VSL_FUNCTION);
    try {
        if (!transaction.begin(error)) return false;
        VSLErrorRef stepError;
        if (!_insertCodeSigningInfo(*entry, *identifier, &stepError) ||
            !_insertCodeSigningData(*entry, *identifier, &stepError)) {
            transaction.rollback(&stepError);
            return failWithError(error, stepError);
        }
        if (entry->childBundleIdentifiers) {
            for (const auto& child : *entry->childBundleIdentifiers) {
                VSLErrorRef childError;
                if (!_performTwoParameterQuery(kInsertChild, "insert", child,
                                               "sqlite3_bind_text for child_code_signing_id_text=%@ at %@ failed: %s",
                                               &*identifier, -1, &childError))
                    VSL_ERROR(kVSLErrorDatabase, childError, true, "Error performing INSERT operation for child %@",
                              child);
            }
        }
        // A failed commit is logged and rolled back; the operation still succeeds.
        transaction.commit(nullptr);
        return true;
    } catch (...) {
        VSLErrorRef e = errorForCaughtException(VSL_FUNCTION, __LINE__);
        transaction.rollback(&e);
        return failWithError(error, e);
    }
}

bool VSLSQLiteDB::deleteCodeSigningEntryWithIdentifier(const std::optional<std::string>& identifier,
                                                       VSLErrorRef* error) {
    generation_.fetch_add(1, std::memory_order_acq_rel);
    if (!identifier)
        return failWithError(
            error, VSL_ERROR(kVSLErrorInvalidArgument, nullptr, true, "identifier %@ cannot be nil", identifier));
    VSLErrorRef queryError;
    if (_performTwoParameterQuery(kDelete, "delete", *identifier,
                                  "sqlite3_bind_text for identifier=%@ at %@ failed: %s", nullptr, 1, &queryError))
        return true;
    return failWithError(error,
                         VSL_ERROR(kVSLErrorDatabase, queryError, true, "failed to delete from code_signing_info"));
}

bool VSLSQLiteDB::invalidateCodeSigningWithIdentifier(const std::string& identifier, VSLErrorRef* error) {
    generation_.fetch_add(1, std::memory_order_acq_rel);
    VSLErrorRef queryError;
    if (_performTwoParameterQuery(kInvalidate, "insert", identifier,
                                  "sqlite3_bind_text for identifier=%@ at %@ failed: %s", nullptr, -1, &queryError))
        return true;
    return failWithError(
        error, VSL_ERROR(kVSLErrorDatabase, queryError, true, "failed to invalidate identifier %@", identifier));
}

bool VSLSQLiteDB::invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier, VSLErrorRef* error) {
    generation_.fetch_add(1, std::memory_order_acq_rel);
    VSLErrorRef childError;
    auto children = childIdentifiersForParentIdentifier(identifier, &childError);
    if (!children && !errorHasCode(childError, kVSLErrorNotInDatabase))
        return failWithError(error, VSL_ERROR(kVSLErrorDatabase, childError, true,
                                              "Error retrieving child bundles ids from DB with identifier %@ : %@",
                                              identifier, childError));
    std::vector<std::string> list{identifier};
    if (children) list.insert(list.end(), children->begin(), children->end());
    VSLSQLiteTransaction transaction(db_, url_, VSL_FUNCTION);
    try {
        if (!transaction.begin(error)) return false;
        for (const auto& item : list) {
            VSLErrorRef itemError;
            if (invalidateCodeSigningWithIdentifier(item, &itemError))
                osLog(LogCategory::Database, OSLogLevel::Debug, "Invalidating code signing info for %@ child: %@",
                      identifier, item);
            else
                LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to invalidate code signing info for %@ child %@ : %@",
                         identifier, item, itemError);
        }
        // A failed commit is logged and rolled back; the operation still succeeds.
        transaction.commit(nullptr);
        return true;
    } catch (...) {
        VSLErrorRef e = errorForCaughtException(VSL_FUNCTION, __LINE__);
        transaction.rollback(&e);
        return failWithError(error, e);
    }
}

bool VSLSQLiteDB::deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(VSLErrorRef* error) {
    generation_.fetch_add(1, std::memory_order_acq_rel);
    VSLSQLiteStatement statement(*statements_);
    if (!statement.prepare(kDeleteAdvanceCopies, "delete", error)) return false;
    if (sqlite3_bind_int(statement.get(), 1, kFlagAdvanceCopy) != SQLITE_OK)
        return failWithError(
            error, VSL_ERROR(kVSLErrorDatabase, nullptr, true, "sqlite3_bind_text for flags=%d at %@ failed: %s",
                             kFlagAdvanceCopy, url_, sqlite3_errmsg(db_)));
    if (!statement.stepToDone(error)) return false;
    int changes = sqlite3_changes(db_);
    if (changes > 0) LogWrite(kLogLevelError, VSL_FUNCTION, "Deleted %d advance copies of code signing info.", changes);
    return true;
}

}  // namespace vsl
