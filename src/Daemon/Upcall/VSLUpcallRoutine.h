// The kernel's container query, apart from any transport: given the sender's audit
// token and the request packbuff, creates whatever containers the process needs and
// gives the return code and the reply packbuff.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

#include "Daemon/Service/VSLCodeSigningService.h"

namespace vsl {

// 0 with the reply in *reply, or KERN_INVALID_ARGUMENT (4), KERN_FAILURE (5) or
// KERN_MEMORY_FAILURE (9) with *reply left empty. Only the kernel (pid 0 in the
// token) is served. A container that cannot be made still gives 0, with a reply
// that holds only the status item, 0.
int32_t server_get_process_containers(const VSLAuditToken& auditToken, const void* request, size_t requestSize,
                                      std::string* reply);

}  // namespace vsl
