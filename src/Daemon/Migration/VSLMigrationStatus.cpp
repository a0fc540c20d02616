#include "Daemon/Migration/VSLMigrationStatus.h"

#include <cerrno>
#include <ctime>
#include <fstream>

#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/DeviceFacts.h"
#include "Platform/DurableIO.h"
#include "Platform/Log.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

constexpr const char* kLastBuildInfo = "LastBuildInfo";
constexpr const char* kBuildVersionKey = "BUILD_ID";
constexpr const char* kReleaseTypeKey = "ReleaseType";

struct MarkerFile {
    const char* name;
    const char* type;
};
constexpr MarkerFile kMarkerFiles[] = {
    {"vsl_bundle_migration_complete.plist", kVSLMigrationBundle},
    {"vsl_acl2_migration_complete.plist", kVSLMigrationACL},
    {"vsl_group_id_migration_complete.plist", kVSLMigrationGroupId},
    {"vsl_code_signing_migration_complete.plist", kVSLMigrationCodeSigning},
};

std::string unquoted(std::string v) {
    if (v.size() >= 2 && (v.front() == '"' || v.front() == '\'') && v.back() == v.front())
        v = v.substr(1, v.size() - 2);
    return v;
}

std::string dateText() {
    std::time_t now = std::time(nullptr);
    std::tm tm{};
    ::gmtime_r(&now, &tm);
    char buf[32];
    std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S +0000", &tm);
    return buf;
}

const std::string* stringEntry(const Value& dictionary, const char* key) {
    const Value* v = dictionary.find(key);
    return v ? v->stringValue() : nullptr;
}

std::string stringOr(const Value& dictionary, const char* key, const char* fallback) {
    const std::string* s = stringEntry(dictionary, key);
    return s ? *s : fallback;
}

}  // namespace

std::optional<Dictionary> currentSystemVersionDictionary() {
    std::ifstream in(rootedPath("/etc/os-release"));
    if (!in) return std::nullopt;
    Dictionary d;
    for (std::string line; std::getline(in, line);) {
        if (line.empty() || line.front() == '#') continue;
        auto eq = line.find('=');
        if (eq == std::string::npos || eq == 0) continue;
        d[line.substr(0, eq)] = Value::string(unquoted(line.substr(eq + 1)));
    }
    if (auto it = d.find("VARIANT_ID"); it != d.end()) d[kReleaseTypeKey] = it->second;
    return d;
}

std::string VSLMigrationStatus::currentBuildVersion() {
    const std::string& build = deviceFacts().buildVersion;
    return build.empty() ? "Unknown" : build;
}

std::unique_ptr<VSLMigrationStatus> VSLMigrationStatus::open(const std::string& path) {
    VSLErrorRef error;
    auto read = VSL_dictionaryWithContentsOfURL(path, 0, &error);
    Dictionary info;
    if (read) {
        info = *read->dictionaryValue();
    } else if (!isPOSIXError(error, ENOENT)) {
        LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to read migration status file at %@ : %@", path, error);
        return nullptr;
    }
    return std::unique_ptr<VSLMigrationStatus>(new VSLMigrationStatus(std::move(info), path));
}

std::unique_ptr<VSLMigrationStatus> VSLMigrationStatus::initForSystemMigration() {
    std::string directory = VSLGlobalConfiguration::sharedInstance()->libraryDirectory();
    auto status = open(directory + "/vsl_migration_status.plist");
    if (!status) {
        LogWrite(kLogLevelError, VSL_FUNCTION, "Error reading system migration file from disk.  This is bad");
        return nullptr;
    }
    if (status->migrationInfo_.empty()) status->foldMarkerFiles(directory);
    return status;
}

std::unique_ptr<VSLMigrationStatus> VSLMigrationStatus::initForMobileUserMigration() {
    auto configuration = VSLGlobalConfiguration::sharedInstance()->getPerUserConfigurationForUserIdentity(
        VSLUserIdentityCache::defaultUserIdentity());
    std::optional<std::string> directory = configuration ? configuration->libraryDirectory() : std::nullopt;
    auto status = directory ? open(*directory + "/vsl_user_migration_status.plist") : nullptr;
    if (!status) {
        LogWrite(kLogLevelError, VSL_FUNCTION, "Error reading user migration file from disk.  This is bad");
        return nullptr;
    }
    return status;
}

void VSLMigrationStatus::foldMarkerFiles(const std::string& directory) {
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Migrating from many marker files down to one");
    for (const auto& marker : kMarkerFiles) {
        std::string path = directory + "/" + marker.name;
        VSLErrorRef error;
        if (auto d = VSL_dictionaryWithContentsOfURL(path, 0, &error))
            migrationInfo_[marker.type] = *d;
        else if (!isPOSIXError(error, ENOENT))
            LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to read migration marker file at %@ : %@", path, error);
    }
    VSLErrorRef error;
    if (!write(&error)) return;  // the markers stay for the next attempt
    for (const auto& marker : kMarkerFiles) {
        std::string path = directory + "/" + marker.name;
        if (durable::removeFile(path) != 0 && errno != ENOENT)
            LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to remove marker file at %@: %@", path,
                     VSL_POSIX_ERROR(errno, "unlink"));
    }
}

bool VSLMigrationStatus::write(VSLErrorRef* error) const {
    if (VSL_writeToURL(Value::dictionary(migrationInfo_), migrationFileURL_,
                       kVSLWriteAtomic | kVSLWriteNoFileProtection, error))
        return true;
    LogWrite(kLogLevelError, VSL_FUNCTION, "Failed to write migration status on %@ for %@ : %@", currentBuildVersion(),
             migrationFileURL_, *error);
    return false;
}

bool VSLMigrationStatus::hasMigrationOccurredForType(const std::string& type) const {
    return migrationInfo_.count(type) != 0;
}

bool VSLMigrationStatus::setMigrationCompleteForType(const std::string& type) {
    std::string build = currentBuildVersion();
    Dictionary entry{{"VSLMigrationVersionNumber", Value::string(build)},
                     {"VSLMigrationTime", Value::string(dateText())}};
    migrationInfo_[type] = Value::dictionary(std::move(entry));
    VSLErrorRef error;
    if (!write(&error)) return false;
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Migration completed on %@ for %@", build, type);
    return true;
}

bool VSLMigrationStatus::writeCurrentBuildInfoToDisk() {
    auto current = currentSystemVersionDictionary();
    migrationInfo_[kLastBuildInfo] = Value::dictionary(current ? *current : Dictionary{});
    VSLErrorRef error;
    if (!write(&error)) return false;
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Saved last build version of %@", currentBuildVersion());
    return true;
}

bool VSLMigrationStatus::isBuildUpgrade() const {
    auto last = migrationInfo_.find(kLastBuildInfo);
    if (last == migrationInfo_.end() || !last->second.isDictionary()) {
        LogWrite(kLogLevelNotice, VSL_FUNCTION,
                 "Did not find last build info; we must be upgrading from pre-9.3.1 or this is an erase install.");
        return true;
    }
    const std::string* lastBuild = stringEntry(last->second, kBuildVersionKey);
    if (!lastBuild) {
        LogWrite(kLogLevelError, VSL_FUNCTION,
                 "Could not get build version from last build info dictionary; assuming this is an upgrade");
        return true;
    }
    auto current = currentSystemVersionDictionary();
    if (!current) {
        LogWrite(kLogLevelError, VSL_FUNCTION, "Could not get current build info; assuming this is an upgrade");
        return true;
    }
    Value currentValue = Value::dictionary(*current);
    const std::string* currentBuild = stringEntry(currentValue, kBuildVersionKey);
    if (!currentBuild) {
        LogWrite(kLogLevelError, VSL_FUNCTION, "Could not get current build string; assuming this is an upgrade");
        return true;
    }
    std::string currentType = stringOr(currentValue, kReleaseTypeKey, "");
    std::string lastType = stringOr(last->second, kReleaseTypeKey, "");
    if (*currentBuild == *lastBuild) {
        LogWrite(kLogLevelNotice, VSL_FUNCTION,
                 "Current build version (%@ / %@) equal to last version recorded (%@ / %@); skipping upgrade",
                 *currentBuild, currentType, *lastBuild, lastType);
        return false;
    }
    LogWrite(kLogLevelNotice, VSL_FUNCTION, "Detected upgrade from %@ (%@) to %@ (%@)", *lastBuild, lastType,
             *currentBuild, currentType);
    return true;
}

}  // namespace vsl
