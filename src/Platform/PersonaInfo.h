// The kernel's persona-information query, answered from the personas file: the
// persona whose "KernelPersonaID" is the id asked about.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>

#include "Platform/UserManagement.h"

namespace vsl {

// The kernel persona types the file's personas get when they name none.
constexpr uint32_t kKernelPersonaTypeOther = 1;
constexpr uint32_t kKernelPersonaTypeEnterprise = 2;

struct KernelPersonaInfo {
    uint32_t version = 1;
    uint32_t personaID = 0;
    // "KernelPersonaType" when the file gives one, else 2 for an enterprise persona
    // and 1 for any other.
    uint32_t type = kKernelPersonaTypeOther;
    std::optional<uid_t> uid;
    std::optional<gid_t> gid;
};

// None when no persona has that id (a failed query).
std::optional<KernelPersonaInfo> kernelPersonaInfo(UserManagement& userManagement, uint32_t personaID);

}  // namespace vsl
