#include "Daemon/Service/VSLCommandTable.h"

#include "Client/VSLProtocol.h"
#include "Daemon/CodeSigning/VSLCodeSigningHandlers.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Migration/VSLMigrationHandlers.h"
#include "Daemon/Service/VSLContainerHandlers.h"
#include "Daemon/Service/VSLContentHandlers.h"
#include "Daemon/Service/VSLEntitlements.h"
#include "Daemon/Service/VSLGroupHandlers.h"
#include "Daemon/Service/VSLInfoHandlers.h"
#include "Daemon/Service/VSLProtectionHandler.h"
#include "Daemon/Service/VSLReplaceHandler.h"
#include "Daemon/Service/VSLRequestDecoding.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

void retiredCommand(const Value&, const VSLReplyRef&, const VSLClientConnectionRef&, uint64_t* code) {
    *code = kVSLErrorInvalidCommand;
}

constexpr const char* A = kVSLEntitlementAllowed;

const VSLCommandRow kCommands[kVSLCommandCount] = {
    {0, handleCreateOrLookup, A, 0x10101},
    {1, handleContainersWithClass, A, 0x10001},
    {2, handleReplaceContainer, A, 0x1},
    {3, handleStageContainerForDelete, A, 0x1},
    {4, handleDeleteContainersOnDeathRow, kVSLEntitlementUserManagedAssets, 0x0},
    {5, handleSetInfoValue, A, 0x1},
    {6, handleInfoValueForKey, A, 0x1},
    {7, handleMetadata, A, 0x1},
    {8, handleRecreateDefaultStructure, A, 0x1},
    {9, handleRegenerateDirectoryUUID, A, 0x1},
    {10, handleDeleteContainer, A, 0x1},
    {11, handleWipeContainer, kVSLEntitlementWipeContainer, 0x1},
    {12, handleDeleteContainerContent, kVSLEntitlementDeleteContainerContent, 0x1},
    {13, handleCreateOrLookupGroupContainers, A, 0x10101},
    {14, handleGroupContainerIdentifiers, A, 0x10001},
    {15, handleSystemContainerPath, A, 0x10101},
    {16, handleSystemGroupContainers, A, 0x10101},
    {17, handleSystemGroupContainerPath, A, 0x10101},
    {18, processCodeSigningInfoCommand, A, 0x1},
    {19, getCodeSigningInfoCommand, A, 0x1},
    {20, invalidateCodeSigningInfoCommand, A, 0x1},
    {21, handleSetDataProtection, A, 0x0},
    {22, handleRecreateDefaultStructure, A, 0x1},
    {23, handleDiskUsage, A, 0x10001},
    {24, handlePerformDataMigration, kVSLEntitlementDataMigration, 0x1},
    {25, handleRetryTest, kVSLEntitlementTestability, 0x1},
    {26, handleStageSharedContent, kVSLEntitlementStageSharedContent, 0x1},
    {27, retiredCommand, A, 0x1},
    {28, handleUserManagedAssetsPath, kVSLEntitlementUserManagedAssets, 0x101},
    {29, handleDeleteUserManagedAsset, kVSLEntitlementUserManagedAssets, 0x1},
    {30, handlePerformPerUserDataMigration, kVSLEntitlementDataMigration, 0x1},
    {31, handleSetTestLock, kVSLEntitlementTestability, 0x1},
    {32, listAccessiblePersonas, A, 0x10101},
};

}  // namespace

const VSLCommandRow& commandRow(uint64_t index) { return kCommands[index]; }

size_t validateCommandTable() {
    static_assert(kVSLProtocolCommandCount == kVSLCommandCount, "protocol and table disagree");
    size_t bad = 0;
    for (uint64_t i = 0; i < kVSLCommandCount; i++) {
        if (kCommands[i].number != i) {
            LogWrite(kLogLevelError, "validateCommandTable", "Invalid command at index %llu", i);
            bad++;
        }
    }
    return bad;
}

}  // namespace vsl
