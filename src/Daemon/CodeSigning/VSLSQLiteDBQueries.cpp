// Reading the code-signing database: one entry, all entries, identifiers, and the
// parent and child links.
#include <sqlite3.h>

#include "Daemon/CodeSigning/VSLSQLiteDB.h"
#include "Daemon/CodeSigning/VSLSQLiteStatement.h"
#include "Platform/Log.h"
#include "Platform/PropertyList.h"

namespace vsl {

namespace {

const char* const kSelectOne =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM code_signing_info, "
    "code_signing_data WHERE code_signing_info.id = code_signing_data.cs_info_id AND "
    "code_signing_info.code_signing_id_text = ?;";
const char* const kSelectAll =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class, "
    "code_signing_info.code_signing_id_text FROM code_signing_info, code_signing_data WHERE code_signing_info.id = "
    "code_signing_data.cs_info_id;";
const char* const kSelectIdentifiers = "SELECT code_signing_info.code_signing_id_text FROM code_signing_info;";
const char* const kSelectChildren =
    "SELECT child_bundles.child_code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "code_signing_info.code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;";
const char* const kSelectParent =
    "SELECT code_signing_info.code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "child_bundles.child_code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;";

std::optional<std::string> columnText(sqlite3_stmt* statement, int column) {
    const unsigned char* text = sqlite3_column_text(statement, column);
    if (!text) return std::nullopt;
    return std::string(reinterpret_cast<const char*>(text),
                       static_cast<size_t>(sqlite3_column_bytes(statement, column)));
}

}  // namespace

std::optional<VSLCodeSigningEntry> VSLSQLiteDB::_codeSigningEntryFromStatementRow(sqlite3_stmt* s, VSLErrorRef* error) {
    const void* blob = sqlite3_column_blob(s, 0);
    if (!blob) {
        failWithError(error, VSL_ERROR(kVSLErrorDatabase, nullptr, true,
                                       "Failed to create code signing entry from statement row"));
        return std::nullopt;
    }
    std::string why;
    auto info = decodePropertyList(blob, static_cast<size_t>(sqlite3_column_bytes(s, 0)), &why);
    if (!info || !info->isDictionary()) {
        failWithError(error, VSL_ERROR(kVSLErrorDatabase, nullptr, true, "Error formatting info data from DB"));
        return std::nullopt;
    }
    VSLCodeSigningEntry entry = VSLCodeSigningEntry::initWithCodeSigningInfo(std::move(*info));
    entry.invalid = sqlite3_column_int(s, 1) != 0;
    int flags = sqlite3_column_int(s, 2);
    entry.placeholder = (flags & kFlagPlaceholder) != 0;
    entry.advanceCopy = (flags & kFlagAdvanceCopy) != 0;
    entry.registeredByCaller = sqlite3_column_int(s, 3) != 0;
    entry.dataContainerClass = static_cast<uint64_t>(static_cast<uint32_t>(sqlite3_column_int(s, 4)));
    return entry;
}

std::optional<VSLCodeSigningEntry> VSLSQLiteDB::codeSigningEntryWithIdentifier(const std::string& identifier,
                                                                               VSLErrorRef* error,
                                                                               bool withChildren) {
    std::optional<VSLCodeSigningEntry> entry;
    {
        VSLSQLiteStatement statement(*statements_);
        VSLErrorRef selectError;
        int rc = SQLITE_ERROR;
        if (statement.prepare(kSelectOne, "select", &selectError) &&
            statement.bindText(1, identifier, "sqlite3_bind_text for identifier=%@ at %@ failed: %s", &selectError)) {
            rc = statement.step();
            if (rc == SQLITE_ROW)
                entry = _codeSigningEntryFromStatementRow(statement.get(), &selectError);
            else if (rc != SQLITE_DONE)
                selectError = statement.stepError();
        }
        if (!entry) {
            if (!selectError && rc == SQLITE_DONE) {
                failWithError(error, VSL_ERROR(kVSLErrorNotInDatabase, nullptr, false,
                                               "Identifier: \"%@\" Not Found in DB", identifier));
                return std::nullopt;
            }
            LogWrite(kLogLevelError, VSL_FUNCTION, "Error retrieving code signing entry: %@", selectError);
            failWithError(error, selectError);
            return std::nullopt;
        }
    }
    if (!withChildren) return entry;
    std::vector<std::string> children;
    VSLErrorRef childError;
    if (!_childIdentifiers(identifier, &children, &childError)) {
        LogWrite(kLogLevelError, VSL_FUNCTION, "Error retrieving childBundleIds: %@", childError);
        failWithError(error, childError);
        return std::nullopt;
    }
    if (!children.empty()) entry->childBundleIdentifiers = std::move(children);
    return entry;
}

VSLErrorRef VSLSQLiteDB::enumerateIdentifiersAndCodeSigningInfoUsingBlock(const EnumerationBlock& block) {
    VSLErrorRef result;
    VSLSQLiteStatement statement(*statements_);
    if (!statement.prepare(kSelectAll, "select", &result)) return result;
    for (;;) {
        int rc = statement.step();
        if (rc == SQLITE_DONE) break;
        if (rc != SQLITE_ROW) return statement.stepError();
        auto entry = _codeSigningEntryFromStatementRow(statement.get(), &result);
        if (!entry) continue;
        auto identifier = columnText(statement.get(), 5);
        if (!identifier || identifier->empty()) {
            result = VSL_ERROR(kVSLErrorDatabase, nullptr, true, "Error retrieving code_signing_id_text from DB");
            continue;
        }
        VSLErrorRef childError;
        if (auto children = childIdentifiersForParentIdentifier(*identifier, &childError)) {
            entry->childBundleIdentifiers = std::move(children);
        } else if (!errorHasCode(childError, kVSLErrorNotInDatabase)) {
            result = VSL_ERROR(kVSLErrorDatabase, childError, true, "Error retrieving childBundleIds: %@", childError);
            continue;
        }
        block(*identifier, *entry);
    }
    return result;
}

std::optional<std::set<std::string>> VSLSQLiteDB::identifiersWithError(VSLErrorRef* error) {
    VSLSQLiteStatement statement(*statements_);
    if (!statement.prepare(kSelectIdentifiers, "select", error)) return std::nullopt;
    std::set<std::string> identifiers;
    for (;;) {
        int rc = statement.step();
        if (rc == SQLITE_DONE) return identifiers;
        if (rc != SQLITE_ROW) {
            failWithError(error, statement.stepError());
            return std::nullopt;
        }
        if (auto text = columnText(statement.get(), 0)) identifiers.insert(std::move(*text));
    }
}

bool VSLSQLiteDB::_childIdentifiers(const std::string& parent, std::vector<std::string>* children,
                                    VSLErrorRef* error) {
    VSLSQLiteStatement statement(*statements_);
    if (!statement.prepare(kSelectChildren, "select", error) ||
        !statement.bindText(1, parent, "sqlite3_bind_text for identifier=%@ at %@ failed: %s", error))
        return false;
    for (;;) {
        int rc = statement.step();
        if (rc == SQLITE_DONE) return true;
        if (rc != SQLITE_ROW) {
            failWithError(error, statement.stepError());
            return false;
        }
        auto text = columnText(statement.get(), 0);
        if (!text) {
            failWithError(error, VSL_ERROR(kVSLErrorAllocation, nullptr, true,
                                           "Failed to allocate thisChildBundleId for text: %s", "(null)"));
            return false;
        }
        children->push_back(std::move(*text));
    }
}

std::optional<std::vector<std::string>> VSLSQLiteDB::childIdentifiersForParentIdentifier(const std::string& parent,
                                                                                         VSLErrorRef* error) {
    std::vector<std::string> children;
    if (!_childIdentifiers(parent, &children, error)) return std::nullopt;
    if (children.empty()) {
        failWithError(error, VSL_ERROR(kVSLErrorNotInDatabase, nullptr, false,
                                       "Children for parent identifier: \"%@\" Not Found in DB", parent));
        return std::nullopt;
    }
    return children;
}

std::optional<std::string> VSLSQLiteDB::parentIdentifierForChildIdentifier(const std::string& child,
                                                                           VSLErrorRef* error) {
    VSLSQLiteStatement statement(*statements_);
    if (!statement.prepare(kSelectParent, "select", error) ||
        !statement.bindText(1, child, "sqlite3_bind_text for identifier=%@ at %@ failed: %s", error))
        return std::nullopt;
    int rc = statement.step();
    if (rc == SQLITE_ROW) {
        if (auto text = columnText(statement.get(), 0)) return text;
        failWithError(error, VSL_ERROR(kVSLErrorAllocation, nullptr, true,
                                       "Failed to allocate parentIdentifier for text: %s", "(null)"));
        return std::nullopt;
    }
    if (rc != SQLITE_DONE) {
        failWithError(error, statement.stepError());
        return std::nullopt;
    }
    failWithError(error, VSL_ERROR(kVSLErrorNotInDatabase, nullptr, false,
                                   "Parent identifier for: \"%@\" Not Found in DB", child));
    return std::nullopt;
}

}  // namespace vsl
