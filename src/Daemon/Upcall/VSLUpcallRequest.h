// The request packbuff of the kernel's container query, unpacked.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace vsl {

struct VSLUpcallRequest {
    std::optional<std::string> codeSignatureID;
    std::optional<std::string> containerID;
    std::optional<std::string> applicationID;
    uint32_t uid = 0;
    uint32_t containerType = 0;
    uint32_t personaID = 0;
    std::vector<std::string> appGroupIDs;  // in arrival order
    std::optional<std::string> systemContainerID;
    std::vector<std::string> systemGroupIDs;
};

// Walks the items; a later single-valued item replaces an earlier one. Returns 0, or
// KERN_FAILURE (5) for an item that cannot be unpacked or a buffer that ends inside
// one, KERN_INVALID_ARGUMENT (4) for an unknown key or a string holding a NUL before
// its terminator, KERN_MEMORY_FAILURE (9) when the bytes cannot be wrapped.
int32_t unpackUpcallRequest(const void* bytes, size_t size, VSLUpcallRequest* request);

}  // namespace vsl
