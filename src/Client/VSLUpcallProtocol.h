// The kernel's container query, shared by the daemon and the clients that play the
// kernel: its message ids, the keys of its request and reply packbuffs, return codes.
#pragma once

#include <cstdint>

namespace vsl {

constexpr uint32_t kVSLUpcallGetProcessContainersID = 322514900;
// The id after the routine's: answered with kVSLUpcallBadID.
constexpr uint32_t kVSLUpcallUnusedID = 322514901;

// Return codes.
constexpr int32_t kVSLUpcallSuccess = 0;
constexpr int32_t kVSLUpcallInvalidArgument = 4;
constexpr int32_t kVSLUpcallFailure = 5;
constexpr int32_t kVSLUpcallMemoryFailure = 9;
constexpr int32_t kVSLUpcallBadID = -303;

// Request items (value types).
enum : uint16_t {
    VW_KERN_REQUEST_CODE_SIGNATURE_ID = 0,
    VW_KERN_REQUEST_CONTAINER_ID = 1,
    VW_KERN_REQUEST_APPLICATION_ID = 2,
    VW_KERN_REQUEST_UID = 3,
    VW_KERN_REQUEST_APP_GROUP_ID = 4,
    VW_KERN_REQUEST_CONTAINER_TYPE = 5,
    VW_KERN_REQUEST_SYSTEM_CONTAINER_ID = 6,
    VW_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID = 7,
    VW_KERN_REQUEST_PERSONA_ID = 8,
};

// Reply items (value types), in the order they are packed; the status comes last.
enum : uint16_t {
    kVSLUpcallReplyHome = 100,
    kVSLUpcallReplyDataContainer = 1,
    kVSLUpcallReplyTemporaryDirectory = 2,
    kVSLUpcallReplyGroupIdentifier = 3,
    kVSLUpcallReplyGroupPath = 4,
    kVSLUpcallReplySystemContainer = 101,
    kVSLUpcallReplySystemGroupIdentifier = 102,
    kVSLUpcallReplySystemGroupPath = 103,
    kVSLUpcallReplyStatus = 0,
};

// VW_KERN_REQUEST_CONTAINER_TYPE values.
constexpr uint32_t kVSLUpcallContainerTypeApplication = 0;
constexpr uint32_t kVSLUpcallContainerTypePlugin = 1;
constexpr uint32_t kVSLUpcallNoPersona = 0xFFFFFFFF;

}  // namespace vsl
