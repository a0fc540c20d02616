#include "Daemon/Storage/VSLLayoutDirectory.h"

namespace vsl {

void createLayoutDirectory(const std::string& path, uid_t owner, VSLDataProtectionClass protectionClass,
                           const char* function, const char* failureMessage) {
    VSLErrorRef error;
    if (!VSLFileManager::defaultManager().createDirectoryAtURL(path, true, 0755, owner, protectionClass, &error))
        LogWrite(kLogLevelError, function, failureMessage, path, error);
}

}  // namespace vsl
