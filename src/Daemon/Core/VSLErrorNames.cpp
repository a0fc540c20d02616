#include "Daemon/Core/VSLErrorNames.h"

#include "Daemon/Core/VSLErrorCodes.h"

namespace vsl {

const char* errorCodeName(uint64_t code) {
    // A switch over the enumeration: a new code without a name here fails the build (-Wswitch).
    switch (static_cast<VSLErrorCode>(code)) {
    case kVSLSuccess: return "Success";
    case kVSLErrorMoveDir: return "MoveDir";
    case kVSLErrorRemoveTransient: return "RemoveTransient";
    case kVSLErrorCreateSubdirectory: return "CreateSubdirectory";
    case kVSLErrorCreateStagingDir: return "CreateStagingDir";
    case kVSLErrorMoveStagingDir: return "MoveStagingDir";
    case kVSLErrorRemoveStagingDir: return "RemoveStagingDir";
    case kVSLErrorInvalidPath: return "InvalidPath";
    case kVSLErrorInvalidObject: return "InvalidObject";
    case kVSLErrorReadFile: return "ReadFile";
    case kVSLErrorReplaceMoveOld: return "ReplaceMoveOld";
    case kVSLErrorReplaceFailed: return "ReplaceFailed";
    case kVSLErrorDestroyDeathRowItem: return "DestroyDeathRowItem";
    case kVSLErrorMissingIdentifier: return "MissingIdentifier";
    case kVSLErrorUnexpectedClass: return "UnexpectedClass";
    case kVSLErrorNotFound: return "NotFound";
    case kVSLErrorReplaceSelf: return "ReplaceSelf";
    case kVSLErrorReplaceClassMismatch: return "ReplaceClassMismatch";
    case kVSLErrorNoInfoValue: return "NoInfoValue";
    case kVSLErrorAlreadyExists: return "AlreadyExists";
    case kVSLErrorDeleteContainer: return "DeleteContainer";
    case kVSLErrorInvalidContent: return "InvalidContent";
    case kVSLErrorInvalidReplaceRecord: return "InvalidReplaceRecord";
    case kVSLErrorWriteFile: return "WriteFile";
    case kVSLErrorReadReplaceRecord: return "ReadReplaceRecord";
    case kVSLErrorRemoveFile: return "RemoveFile";
    case kVSLErrorInvalidArgument: return "InvalidArgument";
    case kVSLErrorException: return "Exception";
    case kVSLErrorMoveToDeathRow: return "MoveToDeathRow";
    case kVSLErrorCacheRebuild: return "CacheRebuild";
    case kVSLErrorCacheInconsistent: return "CacheInconsistent";
    case kVSLErrorCacheAdd: return "CacheAdd";
    case kVSLErrorCacheRemove: return "CacheRemove";
    case kVSLErrorCacheInvalidInput: return "CacheInvalidInput";
    case kVSLErrorMoveToNewUUIDDir: return "MoveToNewUUIDDir";
    case kVSLErrorInvalidCommand: return "InvalidCommand";
    case kVSLErrorNotEntitled: return "NotEntitled";
    case kVSLErrorInputCountMismatch: return "InputCountMismatch";
    case kVSLErrorLockedNoRetry: return "LockedNoRetry";
    case kVSLErrorChangeOwner: return "ChangeOwner";
    case kVSLErrorSetACL: return "SetACL";
    case kVSLErrorSharedContentMove: return "SharedContentMove";
    case kVSLErrorDatabase: return "Database";
    case kVSLErrorNotInDatabase: return "NotInDatabase";
    case kVSLErrorDatabaseChanges: return "DatabaseChanges";
    case kVSLErrorProtectionSuperseded: return "ProtectionSuperseded";
    case kVSLErrorUserManagedAssetsNotFound: return "UserManagedAssetsNotFound";
    case kVSLErrorAllocation: return "Allocation";
    case kVSLErrorUserIdentityPlist: return "UserIdentityPlist";
    case kVSLErrorWrongPersona: return "WrongPersona";
    }
    return "Unknown";
}

}  // namespace vsl
