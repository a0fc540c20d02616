// Every path the daemon owns on disk, in one place: the global directories below the
// superuser's home and /private/var/containers, and, per user identity, a
// VSLPerUserConfiguration. Each directory accessor (re-)creates its directory with
// its fixed mode, owner and protection class on every call and returns the path even
// when that failed. All paths lie below the system root.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "Daemon/Core/VSLContainerClass.h"
#include "Daemon/Core/VSLUserIdentity.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLPerUserConfiguration.h"

namespace vsl {

class VSLGlobalConfiguration {
public:
    // The process's instance, made on first use.
    static std::shared_ptr<VSLGlobalConfiguration> sharedInstance();
    // Tests that switch system roots start over with a fresh instance.
    static void resetSharedInstanceForTesting();

    VSLGlobalConfiguration();

    const std::string& homeDirectory() const { return homeDirectory_; }  // /private/var/root

    std::string sharedContainersDirectory();  // /private/var/containers
    std::string bundleDirectory();            // .../containers/Bundle
    std::string transientBundleDirectory();   // .../containers/Temp, installer-owned
    std::string cachesDirectory();            // home/Library/Caches/com.tarrow.vesseld, class 4
    std::string libraryDirectory();           // home/Library/Vesselry, class 4
    std::string logDirectory();               // home/Library/Logs/Vesselry, class 4; not cached
    std::string stagingDirectory();           // caches/Staging
    std::string deathrowDirectory();          // caches/Dead
    std::string replaceDirectory();           // library/Replace
    std::string pendingUpdatesDirectory();    // library/PendingUpdates
    std::string transientDirectory();         // caches/Temp

    // /private/var/stowaged/Library/Caches/com.tarrow.vesseld when something is there.
    std::optional<std::string> legacyTransientBundleDirectory() const;

    // Bundle (1, 3, 5, 8) and system (12, 13) classes only; creates only the base.
    std::optional<std::string> globalContainerBaseURLWithContentClass(VSLContainerClass containerClass,
                                                                      bool transient);
    // The directory holding containers of the class, created (bundle classes owned by
    // the installer); per-user classes go to the user identity's configuration.
    std::optional<std::string> containerDirectoryURLForUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                                    VSLContainerClass containerClass, bool transient);
    std::optional<std::string> stagingDirectoryURLForUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                                  VSLContainerClass containerClass);
    std::shared_ptr<VSLPerUserConfiguration> getPerUserConfigurationForUserIdentity(
        const VSLUserIdentityRef& userIdentity);

    // Top-level items of a data container that are the application's user data, and
    // the one that never is.
    static std::vector<std::string> appUserDataItemNames();
    static std::vector<std::string> excludedFromAppUserData();

    bool migrationFileExistsWithName(const std::string& name);

    bool isInternalImage();
    void setIsInternalImage(bool isInternalImage);

    uint32_t currentMobileUserId() const { return currentMobileUserId_; }
    uint32_t currentMobileGroupId() const { return currentMobileGroupId_; }

private:
    std::string directory(std::optional<std::string>& field, const std::string& parent, const char* component,
                          uid_t owner, VSLDataProtectionClass protectionClass, const char* function, const char* failureMessage);

    std::recursive_mutex mutex_;
    std::string homeDirectory_;
    std::optional<std::string> sharedContainersDirectory_;
    std::optional<std::string> cachesDirectory_;
    std::optional<std::string> libraryDirectory_;
    std::optional<std::string> stagingDirectory_;
    std::optional<std::string> deathrowDirectory_;
    std::optional<std::string> replaceDirectory_;
    std::optional<std::string> pendingUpdatesDirectory_;
    std::optional<std::string> bundleDirectory_;
    std::optional<std::string> transientDirectory_;
    std::optional<std::string> transientBundleDirectory_;
    uint32_t currentMobileUserId_ = 0;
    std::unordered_map<VSLUserIdentityRef, std::shared_ptr<VSLPerUserConfiguration>, VSLUserIdentityHash,
                       VSLUserIdentityEqual>
        perUserConfigurations_;
    std::once_flag internalImageOnce_;
    std::atomic<bool> isInternalImage_{false};
    uint32_t currentMobileGroupId_ = 0;
};

}  // namespace vsl
