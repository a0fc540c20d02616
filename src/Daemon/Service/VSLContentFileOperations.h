// The file-system steps of the asset removal, behind one table so that tests can
// change the disk between the check of a client's path and the removal.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include "Daemon/Core/VSLError.h"

namespace vsl {

struct VSLContentFileOperations {
    // The real path (links followed); none when it cannot be had.
    std::function<std::optional<std::string>(const std::string& url)> realPath;
    // The file manager's removal of a path below a directory, through descriptors.
    std::function<bool(const std::string& directory, const std::string& relativePath, VSLErrorRef* error)>
        removeItemBelowDirectory;
};

VSLContentFileOperations defaultContentFileOperations();
VSLContentFileOperations currentContentFileOperations();
// Tests: none restores the real steps.
void setContentFileOperationsForTesting(std::optional<VSLContentFileOperations> operations);

}  // namespace vsl
