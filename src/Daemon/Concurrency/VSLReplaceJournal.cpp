#include "Daemon/Concurrency/VSLReplaceJournal.h"

#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLPropertyListFile.h"

namespace vsl {

const char* const kVSLReplaceOperationOldURL = "VSLReplaceOperationOldURL";
const char* const kVSLReplaceOperationNewURL = "VSLReplaceOperationNewURL";
const char* const kVSLReplaceOperationStagingURL = "VSLReplaceOperationStagingURL";
const char* const kVSLReplaceOperationDestURL = "VSLReplaceOperationDestURL";

namespace {

// A journal names directories the daemon moves as root: anything but a plain
// absolute path is refused rather than interpreted.
std::optional<std::string> directoryPath(const std::string& path) {
    if (path.empty() || path[0] != '/' || containsDotDotPathComponents(path)) return std::nullopt;
    std::string out = path;
    while (out.size() > 1 && out.back() == '/') out.pop_back();
    if (out == "/") return std::nullopt;
    return out;
}

std::string describe(const Value* v) { return v ? v->description() : std::string("(null)"); }

}  // namespace

bool _writeToDiskReplaceAt(const std::string& journalURL, const std::optional<std::string>& oldURL,
                           const std::optional<std::string>& newURL, const std::optional<std::string>& stagingURL,
                           const std::optional<std::string>& destURL, VSLErrorRef* error) {
    if (!oldURL || !newURL || !stagingURL || !destURL) {
        auto e = VSL_ERROR(kVSLErrorInvalidReplaceRecord, nullptr, true,
                           "Invalid Replace File Info: old: %@, new: %@, staging: %@, dest: %@",
                           oldURL.value_or("(null)"), newURL.value_or("(null)"), stagingURL.value_or("(null)"),
                           destURL.value_or("(null)"));
        if (error) *error = e;
        return false;
    }
    Value journal = Value::dictionary({{kVSLReplaceOperationOldURL, Value::string(*oldURL)},
                                       {kVSLReplaceOperationNewURL, Value::string(*newURL)},
                                       {kVSLReplaceOperationStagingURL, Value::string(*stagingURL)},
                                       {kVSLReplaceOperationDestURL, Value::string(*destURL)}});
    VSLErrorRef underlying;
    if (!VSL_writeToURL(journal, journalURL, kVSLWriteAtomic | kVSLWriteNoFileProtection, &underlying)) {
        auto e = VSL_ERROR(kVSLErrorWriteFile, underlying, true, "Failed to write replace dictionary to URL %@",
                           journalURL);
        if (error) *error = e;
        return false;
    }
    return true;
}

std::optional<VSLReplaceJournal> _readAndValidateReplaceFileAtUrl(const std::string& url, VSLErrorRef* error) {
    VSLErrorRef underlying;
    auto dictionary = VSL_dictionaryWithContentsOfURL(url, 0, &underlying);
    if (!dictionary) {
        auto e = VSL_ERROR(kVSLErrorReadReplaceRecord, underlying, true, "Failed to read replace file at URL %@", url);
        if (error) *error = e;
        return std::nullopt;
    }
    const Value* values[4] = {dictionary->find(kVSLReplaceOperationOldURL),
                              dictionary->find(kVSLReplaceOperationNewURL),
                              dictionary->find(kVSLReplaceOperationStagingURL),
                              dictionary->find(kVSLReplaceOperationDestURL)};
    std::optional<std::string> paths[4];
    bool valid = true;
    for (int i = 0; i < 4; i++) {
        const std::string* s = values[i] ? values[i]->stringValue() : nullptr;
        if (s) paths[i] = directoryPath(*s);
        valid = valid && paths[i];
    }
    if (!valid) {
        auto e = VSL_ERROR(kVSLErrorReadReplaceRecord, nullptr, true,
                           "Invalid replace data: Old: %@, New: %@, Staging: %@, Dest: %@", describe(values[0]),
                           describe(values[1]), describe(values[2]), describe(values[3]));
        if (error) *error = e;
        return std::nullopt;
    }
    return VSLReplaceJournal{*paths[0], *paths[1], *paths[2], *paths[3]};
}

}  // namespace vsl
