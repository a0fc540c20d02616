// Handlers of the commands on one existing container: setInfoValue (5),
// infoValueForKey (6), metadata (7), recreateDefaultStructure (8 and 22),
// regenerateDirectoryUUID (9) and diskUsage (23); and the test controls retryTest (25)
// and setTestLock (31), which act only on internal builds.
#pragma once

#include "Daemon/Service/VSLCommandTable.h"

namespace vsl {

void handleSetInfoValue(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                        uint64_t* code);
void handleInfoValueForKey(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                           uint64_t* code);
void handleMetadata(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                    uint64_t* code);
void handleRecreateDefaultStructure(const Value& request, const VSLReplyRef& reply,
                                    const VSLClientConnectionRef& connection, uint64_t* code);
void handleRegenerateDirectoryUUID(const Value& request, const VSLReplyRef& reply,
                                   const VSLClientConnectionRef& connection, uint64_t* code);
void handleDiskUsage(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                     uint64_t* code);
void handleRetryTest(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                     uint64_t* code);
// Lock numbers 0..6; 7 with "Enable" false releases every lock.
void handleSetTestLock(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                       uint64_t* code);

}  // namespace vsl
