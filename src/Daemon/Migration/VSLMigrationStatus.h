// Which one-time migrations have run on this device, and which build last booted: one
// small dictionary file for the system and one for the default user.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "Daemon/Core/VSLError.h"
#include "Platform/Value.h"

namespace vsl {

inline constexpr const char* kVSLMigrationBundle = "BundleMigration";
inline constexpr const char* kVSLMigrationACL = "ACLMigration";
inline constexpr const char* kVSLMigrationGroupId = "GroupIdMigration";
inline constexpr const char* kVSLMigrationCodeSigning = "CodeSigningMigration";
inline constexpr const char* kVSLMigrationSubdirectory = "SubdirectoryMigration";

// The running system's version: the KEY=value pairs of etc/os-release, with
// "ReleaseType" copied from VARIANT_ID. None when the file cannot be read.
std::optional<Dictionary> currentSystemVersionDictionary();

class VSLMigrationStatus {
public:
    // Null, having logged, when the file exists but cannot be read. An empty system
    // status takes in the marker files older builds left, once.
    static std::unique_ptr<VSLMigrationStatus> initForSystemMigration();
    static std::unique_ptr<VSLMigrationStatus> initForMobileUserMigration();

    bool hasMigrationOccurredForType(const std::string& type) const;
    bool setMigrationCompleteForType(const std::string& type);
    bool writeCurrentBuildInfoToDisk();
    // True whenever it cannot tell.
    bool isBuildUpgrade() const;

    // BUILD_ID of the running system, "Unknown" without one.
    static std::string currentBuildVersion();

    const Dictionary& migrationInfo() const { return migrationInfo_; }
    const std::string& migrationFileURL() const { return migrationFileURL_; }

private:
    VSLMigrationStatus(Dictionary info, std::string path)
        : migrationInfo_(std::move(info)), migrationFileURL_(std::move(path)) {}
    static std::unique_ptr<VSLMigrationStatus> open(const std::string& path);
    bool write(VSLErrorRef* error) const;
    void foldMarkerFiles(const std::string& directory);

    Dictionary migrationInfo_;
    std::string migrationFileURL_;
};

}  // namespace vsl
