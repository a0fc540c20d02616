// The daemon's one numbering of result codes; the same numbers reach clients in
// "ReplyError". 1 means success: code out-parameters start at 1 and are written
// only on failure.
#pragma once

#include <cstdint>

namespace vsl {

enum VSLErrorCode : uint64_t {
    kVSLSuccess = 1,
    kVSLErrorMoveDir = 4,
    kVSLErrorRemoveTransient = 5,
    kVSLErrorCreateSubdirectory = 6,
    kVSLErrorCreateStagingDir = 7,
    kVSLErrorMoveStagingDir = 8,
    kVSLErrorRemoveStagingDir = 9,
    kVSLErrorInvalidPath = 10,
    kVSLErrorInvalidObject = 11,
    kVSLErrorReadFile = 12,
    kVSLErrorReplaceMoveOld = 14,
    kVSLErrorReplaceFailed = 15,
    kVSLErrorDestroyDeathRowItem = 17,
    kVSLErrorMissingIdentifier = 18,
    kVSLErrorUnexpectedClass = 20,
    kVSLErrorNotFound = 21,
    kVSLErrorReplaceSelf = 22,
    kVSLErrorReplaceClassMismatch = 23,
    kVSLErrorNoInfoValue = 24,
    kVSLErrorAlreadyExists = 27,
    kVSLErrorDeleteContainer = 28,
    kVSLErrorInvalidContent = 29,
    kVSLErrorInvalidReplaceRecord = 33,
    kVSLErrorWriteFile = 34,
    kVSLErrorReadReplaceRecord = 35,
    kVSLErrorRemoveFile = 36,
    kVSLErrorInvalidArgument = 38,
    kVSLErrorException = 40,
    kVSLErrorMoveToDeathRow = 41,
    kVSLErrorCacheRebuild = 43,
    kVSLErrorCacheInconsistent = 44,
    kVSLErrorCacheAdd = 45,
    kVSLErrorCacheRemove = 46,
    kVSLErrorCacheInvalidInput = 47,
    kVSLErrorMoveToNewUUIDDir = 48,
    kVSLErrorInvalidCommand = 49,
    kVSLErrorNotEntitled = 55,
    kVSLErrorInputCountMismatch = 60,
    kVSLErrorLockedNoRetry = 61,
    kVSLErrorChangeOwner = 62,
    kVSLErrorSetACL = 63,
    kVSLErrorSharedContentMove = 64,
    kVSLErrorDatabase = 66,
    kVSLErrorNotInDatabase = 67,
    kVSLErrorDatabaseChanges = 68,
    kVSLErrorProtectionSuperseded = 69,
    kVSLErrorUserManagedAssetsNotFound = 71,
    kVSLErrorAllocation = 73,
    kVSLErrorUserIdentityPlist = 75,
    kVSLErrorWrongPersona = 76,
};

// Code of a non-dictionary property-list root, in the platform's general domain.
constexpr int64_t kGeneralErrorNotADictionary = 2048;

}  // namespace vsl
