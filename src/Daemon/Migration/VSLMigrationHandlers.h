// Client commands that run the data migrations.
#pragma once

#include "Daemon/Service/VSLCommandTable.h"

namespace vsl {

void handlePerformDataMigration(const Value& request, const VSLReplyRef& reply,
                                const VSLClientConnectionRef& connection, uint64_t* code);

void handlePerformPerUserDataMigration(const Value& request, const VSLReplyRef& reply,
                                       const VSLClientConnectionRef& connection, uint64_t* code);

}  // namespace vsl
