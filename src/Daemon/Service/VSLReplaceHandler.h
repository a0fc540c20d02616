// Handler of replaceContainer (2): the new container takes the old one's place.
#pragma once

#include "Daemon/Service/VSLCommandTable.h"

namespace vsl {

// The old identity may be left out entirely (no "OldIdentifier"): the new container is
// then promoted. Any other decoding failure ends the command before a lock is taken.
void handleReplaceContainer(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef& connection,
                            uint64_t* code);

}  // namespace vsl
