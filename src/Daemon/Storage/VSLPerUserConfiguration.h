// Where one user identity's containers and daemon files live below its home, each
// directory made on demand (mode 0755, owned by the user's uid) and re-made on the
// next call when something removed it.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "Daemon/Core/VSLContainerClass.h"
#include "Daemon/Core/VSLUserIdentity.h"

namespace vsl {

class VSLPerUserConfiguration {
public:
    // Also made for an identity without a home directory; every path is then none.
    static std::shared_ptr<VSLPerUserConfiguration> initWithUserIdentity(const VSLUserIdentityRef& userIdentity);

    const VSLUserIdentityRef& userIdentity() const { return userIdentity_; }
    const std::optional<std::string>& userHomeDirectory() const { return userHomeDirectory_; }

    std::optional<std::string> userBaseDirectory();    // home/Containers
    std::optional<std::string> transientDirectory();   // home/Containers/Temp
    std::optional<std::string> stagingDirectory();     // home/Containers/Staging
    std::optional<std::string> libraryDirectory();     // home/Library/Vesselry

    // Classes 2, 4, 6, 7, 9, 10, 11 only, below Containers (or Containers/Temp).
    std::optional<std::string> containerDirectoryURLForContentClass(VSLContainerClass containerClass, bool transient);

    // Computed, never created.
    std::optional<std::string> systemContainerBackupBaseDirectory();   // home/Library/Backup/SystemContainers
    std::optional<std::string> systemContainerBackupDirectory();       // .../Data
    std::optional<std::string> systemGroupContainerBackupDirectory();  // .../Shared
    std::optional<std::string> oldLoggingPath();                       // home/Library/Logs/Vesselry

    // Whether the home directory itself exists.
    bool existsUserBaseDirectory() const;

    // For the global configuration, which holds its own lock while it calls in here.
    std::recursive_mutex& monitor() { return mutex_; }

private:
    explicit VSLPerUserConfiguration(VSLUserIdentityRef userIdentity);
    // Computes `field` once from `parent` + `component`, then (re-)creates it.
    std::optional<std::string> directory(std::optional<std::string>& field, const std::optional<std::string>& parent,
                                         const char* component, const char* function, const char* failureMessage);

    std::recursive_mutex mutex_;
    VSLUserIdentityRef userIdentity_;
    std::optional<std::string> userBaseDirectory_;
    std::optional<std::string> transientDirectory_;
    std::optional<std::string> stagingDirectory_;
    std::optional<std::string> libraryDirectory_;
    std::optional<std::string> systemContainerBackupBaseDirectory_;
    std::optional<std::string> systemContainerBackupDirectory_;
    std::optional<std::string> systemGroupContainerBackupDirectory_;
    std::optional<std::string> userHomeDirectory_;
};

}  // namespace vsl
