#pragma once

namespace vsl {

inline constexpr const char* kVSLEntitlementAllowed = "com.tarrow.private.Vesselry.allowed";
inline constexpr const char* kVSLEntitlementUserManagedAssets = "com.tarrow.private.Vesselry.userManagedAssets";
inline constexpr const char* kVSLEntitlementWipeContainer = "com.tarrow.private.Vesselry.wipeContainer";
inline constexpr const char* kVSLEntitlementDeleteContainerContent =
    "com.tarrow.private.Vesselry.deleteContainerContent";
inline constexpr const char* kVSLEntitlementDataMigration = "com.tarrow.private.Vesselry.dataMigration";
inline constexpr const char* kVSLEntitlementTestability = "com.tarrow.private.Vesselry.testability";
inline constexpr const char* kVSLEntitlementStageSharedContent = "com.tarrow.private.Vesselry.stageSharedContent";
inline constexpr const char* kVSLEntitlementOtherIdLookup = "com.tarrow.private.Vesselry.otherIdLookup";
inline constexpr const char* kVSLEntitlementLookup = "com.tarrow.private.Vesselry.lookup";

// The installer's signing identifier: its identity is cached per audit token.
inline constexpr const char* kVSLInstallerSigningIdentifier = "com.tarrow.stowaged";
inline constexpr const char* kVSLInternalBundleIdentifier = "com.tarrow.vesseld.internal";

}  // namespace vsl
