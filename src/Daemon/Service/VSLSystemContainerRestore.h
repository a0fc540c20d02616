// System containers restored from a backup: installed at the first start after boot.
#pragma once

#include <string>

#include "Daemon/Core/VSLContainerClass.h"
#include "Daemon/Service/VSLClientConnection.h"

namespace vsl {

// The backup's "Data" (class 12) and "Shared" (class 13) directories are renamed to an
// "inprogress" sibling and each item in them installed; on non-internal builds the
// backup base directory is removed afterwards.
void VSLMoveSystemContainersIntoPlace(const VSLClientConnectionRef& connection);

// One restored item: its name is the identifier; its children replace the container's
// entries of the same name, and a child that cannot be placed goes to the "failed"
// sibling of the item's directory. Then the default structure is re-created.
void _moveSystemContainerIntoPlace(const std::string& item, VSLContainerClass containerClass,
                                   const VSLClientConnectionRef& connection);

}  // namespace vsl
