// The code-signing database: one SQLite file, "containers.sqlite3" in the daemon's
// library directory, holding every identifier's code-signing entry and its child
// bundles. Only the code-signing mapping uses it, from its own serial queue, so
// there is no locking here. A file that cannot be opened or initialised ends the
// process: the daemon does not run without its database.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Daemon/CodeSigning/VSLCodeSigningEntry.h"
#include "Daemon/Core/VSLError.h"

struct sqlite3;
struct sqlite3_stmt;

namespace vsl {

class VSLSQLiteStatementCache;

extern const char* const kVSLCodeSigningDatabaseFileName;  // "containers.sqlite3"

class VSLSQLiteDB {
    struct Passkey {};

public:
    // None when the location cannot be built (no directory given).
    static std::unique_ptr<VSLSQLiteDB> initWithParentDirectoryURL(const std::string& parentDirectoryURL);
    // Opens or creates the file, applies the connection settings and the schema.
    // Never returns on failure.
    static sqlite3* openDBWithURL(const std::string& url);

    VSLSQLiteDB(Passkey, sqlite3* db, std::string url);
    ~VSLSQLiteDB();
    VSLSQLiteDB(const VSLSQLiteDB&) = delete;
    VSLSQLiteDB& operator=(const VSLSQLiteDB&) = delete;

    void closeDB();
    const std::string& url() const { return url_; }
    // Moves before every write (and on close), so an answer read at one generation is
    // still the stored one while the generation stays; readable from any thread.
    uint64_t generation() const { return generation_.load(std::memory_order_acquire); }

    // Insert or update the row, its data and its child rows, in one transaction.
    bool addCodeSigningEntry(const VSLCodeSigningEntry* entry, const std::optional<std::string>& identifier,
                             VSLErrorRef* error);
    // Removes the row with its data and child rows; an identifier not stored fails.
    bool deleteCodeSigningEntryWithIdentifier(const std::optional<std::string>& identifier, VSLErrorRef* error);
    // Not stored: none with a code-67 error. `withChildren` false leaves the child
    // bundle identifiers unread (none), for readers that do not look at them.
    std::optional<VSLCodeSigningEntry> codeSigningEntryWithIdentifier(const std::string& identifier,
                                                                      VSLErrorRef* error, bool withChildren = true);
    bool invalidateCodeSigningWithIdentifier(const std::string& identifier, VSLErrorRef* error);
    bool invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier, VSLErrorRef* error);
    // Calls `block` for every stored entry; returns the last error met, or none.
    using EnumerationBlock = std::function<void(const std::string& identifier, const VSLCodeSigningEntry& entry)>;
    VSLErrorRef enumerateIdentifiersAndCodeSigningInfoUsingBlock(const EnumerationBlock& block);
    std::optional<std::set<std::string>> identifiersWithError(VSLErrorRef* error);
    // No children: none with a code-67 error.
    std::optional<std::vector<std::string>> childIdentifiersForParentIdentifier(const std::string& parent,
                                                                                VSLErrorRef* error);
    // No parent: none with a code-67 error.
    std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& child, VSLErrorRef* error);
    bool deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(VSLErrorRef* error);

private:
    // Bits of the `placeholder` column.
    static constexpr int kFlagPlaceholder = 1;
    static constexpr int kFlagAdvanceCopy = 2;

    bool _sqliteExec(const char* sql, VSLErrorRef* error);
    bool _performInsertOrUpdateQuery(const char* sql, const VSLCodeSigningEntry& entry, const std::string& identifier,
                                     bool isUpdate, VSLErrorRef* error);
    bool _insertCodeSigningInfo(const VSLCodeSigningEntry& entry, const std::string& identifier, VSLErrorRef* error);
    bool _insertCodeSigningData(const VSLCodeSigningEntry& entry, const std::string& identifier, VSLErrorRef* error);
    // `expectedChanges` -1: the change count is not checked.
    bool _performTwoParameterQuery(const char* sql, const char* kind, const std::string& textOne,
                                   const char* textOneFailureFormat, const std::string* textTwo, int expectedChanges,
                                   VSLErrorRef* error);
    std::optional<VSLCodeSigningEntry> _codeSigningEntryFromStatementRow(sqlite3_stmt* statement, VSLErrorRef* error);
    // Appends the children of `parent` (none is not an error).
    bool _childIdentifiers(const std::string& parent, std::vector<std::string>* children, VSLErrorRef* error);

    sqlite3* db_;
    std::string url_;
    std::unique_ptr<VSLSQLiteStatementCache> statements_;
    std::atomic<uint64_t> generation_{1};
};

}  // namespace vsl
