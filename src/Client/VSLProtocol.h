// The command numbers of the vesseld protocol, shared by clients and the daemon.
#pragma once

#include <cstdint>
#include <cstring>
#include <optional>

namespace vsl {

inline constexpr const char* kVSLCommandNames[] = {
    "createOrLookup",
    "containersWithClass",
    "replaceContainer",
    "stageContainerForDelete",
    "deleteContainersOnDeathRow",
    "setInfoValue",
    "infoValueForKey",
    "metadata",
    "recreateDefaultStructure",
    "regenerateDirectoryUUID",
    "deleteContainer",
    "wipeContainer",
    "deleteContainerContent",
    "createOrLookupGroupContainers",
    "groupContainerIdentifiers",
    "systemContainerPath",
    "systemGroupContainers",
    "systemGroupContainerPath",
    "processCodeSigningInfo",
    "getCodeSigningInfo",
    "invalidateCodeSigningInfo",
    "setDataProtection",
    "recreateDefaultStructure2",
    "diskUsage",
    "performDataMigration",
    "retryTest",
    "stageSharedContent",
    "retired27",
    "userManagedAssetsPath",
    "deleteUserManagedAsset",
    "performPerUserDataMigration",
    "setTestLock",
    "personaUniqueStrings",
};

inline constexpr uint64_t kVSLProtocolCommandCount = sizeof(kVSLCommandNames) / sizeof(kVSLCommandNames[0]);

inline const char* commandName(uint64_t number) {
    return number < kVSLProtocolCommandCount ? kVSLCommandNames[number] : nullptr;
}

inline std::optional<uint64_t> commandNumberForName(const char* name) {
    for (uint64_t i = 0; i < kVSLProtocolCommandCount; i++)
        if (std::strcmp(kVSLCommandNames[i], name) == 0) return i;
    return std::nullopt;
}

}  // namespace vsl
