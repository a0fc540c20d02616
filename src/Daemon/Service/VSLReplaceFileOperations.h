// The file-system steps of a container replacement and of its recovery at start,
// behind one table so that tests can make a chosen step fail or watch the order.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include "Daemon/Core/VSLError.h"

namespace vsl {

class VSLClientConnection;

struct VSLReplaceFileOperations {
    // A durable move of a whole directory (the file manager's move).
    std::function<bool(const std::string& from, const std::string& to, VSLErrorRef* error)> moveItem;
    std::function<bool(const std::string& url)> itemExists;
    // The connection's move to death row.
    std::function<bool(VSLClientConnection& connection, const std::string& url, bool isDir, bool startDeletionThread,
                       VSLErrorRef* error)>
        moveToDeathRow;
};

// The real steps.
VSLReplaceFileOperations defaultReplaceFileOperations();
// What replacements use now.
VSLReplaceFileOperations currentReplaceFileOperations();
// Tests: none restores the real steps.
void setReplaceFileOperationsForTesting(std::optional<VSLReplaceFileOperations> operations);

}  // namespace vsl
