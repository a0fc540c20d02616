#include "Daemon/Storage/VSLGlobalConfiguration.h"

#include "Daemon/Storage/VSLLayoutDirectory.h"
#include "Platform/DeviceFacts.h"
#include "Platform/PasswordDatabase.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

// The daemon's own caches and library hold nothing that must wait for the first unlock.
constexpr VSLDataProtectionClass kDaemonDirectoryClass = kVSLDataProtectionClassNoProtection;
constexpr uid_t kOwnerUnchanged = 0;

std::mutex gSharedMutex;
std::shared_ptr<VSLGlobalConfiguration>& sharedStorage() {
    static std::shared_ptr<VSLGlobalConfiguration> instance;
    return instance;
}

}  // namespace

std::shared_ptr<VSLGlobalConfiguration> VSLGlobalConfiguration::sharedInstance() {
    std::lock_guard<std::mutex> lock(gSharedMutex);
    auto& instance = sharedStorage();
    if (!instance) instance = std::make_shared<VSLGlobalConfiguration>();
    return instance;
}

void VSLGlobalConfiguration::resetSharedInstanceForTesting() {
    std::lock_guard<std::mutex> lock(gSharedMutex);
    sharedStorage().reset();
}

VSLGlobalConfiguration::VSLGlobalConfiguration() : homeDirectory_(rootedPath("/private/var/root")) {
    static const char* const fn = "-[VSLGlobalConfiguration init]";
    if (auto mobile = passwordEntryForName("mobile")) {
        currentMobileUserId_ = mobile->uid;
        currentMobileGroupId_ = mobile->gid;
        LogWrite(kLogLevelError, fn, "Current mobile user ID is %u, group ID is %u", currentMobileUserId_,
                 currentMobileGroupId_);
    } else {
        LogWrite(kLogLevelError, fn, "Failed to get mobile uid. This is bad");
    }
}

std::string VSLGlobalConfiguration::directory(std::optional<std::string>& field, const std::string& parent,
                                              const char* component, uid_t owner,
                                              VSLDataProtectionClass protectionClass, const char* function,
                                              const char* failureMessage) {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    if (!field) field = component ? joinPath(parent, component) : parent;
    createLayoutDirectory(*field, owner, protectionClass, function, failureMessage);
    return *field;
}

std::string VSLGlobalConfiguration::sharedContainersDirectory() {
    return directory(sharedContainersDirectory_, rootedPath("/private/var/containers"), nullptr, kOwnerUnchanged,
                     kVSLDataProtectionClassUnset, "-[VSLGlobalConfiguration sharedContainersDirectory]",
                     "Failed to create shared container dir at \"%@\": %@");
}

std::string VSLGlobalConfiguration::bundleDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    return directory(bundleDirectory_, sharedContainersDirectory(), "Bundle", kOwnerUnchanged,
                     kVSLDataProtectionClassUnset, "-[VSLGlobalConfiguration bundleDirectory]",
                     "Failed to create bundle dir at \"%@\": %@");
}

std::string VSLGlobalConfiguration::transientBundleDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    return directory(transientBundleDirectory_, sharedContainersDirectory(), "Temp", deviceFacts().installerUID,
                     kVSLDataProtectionClassUnset, "-[VSLGlobalConfiguration transientBundleDirectory]",
                     "Failed to create transient bundle dir at \"%@\": %@");
}

std::string VSLGlobalConfiguration::cachesDirectory() {
    return directory(cachesDirectory_, homeDirectory_, "Library/Caches/com.tarrow.vesseld", kOwnerUnchanged,
                     kDaemonDirectoryClass, "-[VSLGlobalConfiguration cachesDirectory]",
                     "Failed to create cache dir at \"%@\": %@");
}

std::string VSLGlobalConfiguration::libraryDirectory() {
    return directory(libraryDirectory_, homeDirectory_, "Library/Vesselry", kOwnerUnchanged, kDaemonDirectoryClass,
                     "-[VSLGlobalConfiguration libraryDirectory]", "Failed to create library dir at \"%@\": %@");
}

std::string VSLGlobalConfiguration::logDirectory() {
    std::optional<std::string> uncached;
    return directory(uncached, homeDirectory_, "Library/Logs/Vesselry", kOwnerUnchanged, kDaemonDirectoryClass,
                     "-[VSLGlobalConfiguration logDirectory]", "Failed to create log directory at \"%@\": %@");
}

std::string VSLGlobalConfiguration::stagingDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    return directory(stagingDirectory_, cachesDirectory(), "Staging", kOwnerUnchanged, kVSLDataProtectionClassUnset,
                     "-[VSLGlobalConfiguration stagingDirectory]", "Failed to create staging dir at \"%@\": %@");
}

std::string VSLGlobalConfiguration::deathrowDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    return directory(deathrowDirectory_, cachesDirectory(), "Dead", kOwnerUnchanged, kVSLDataProtectionClassUnset,
                     "-[VSLGlobalConfiguration deathrowDirectory]", "Failed to create deathrow dir at \"%@\": %@");
}

std::string VSLGlobalConfiguration::replaceDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    return directory(replaceDirectory_, libraryDirectory(), "Replace", kOwnerUnchanged, kVSLDataProtectionClassUnset,
                     "-[VSLGlobalConfiguration replaceDirectory]", "Failed to create replace dir at \"%@\": %@");
}

std::string VSLGlobalConfiguration::pendingUpdatesDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    return directory(pendingUpdatesDirectory_, libraryDirectory(), "PendingUpdates", kOwnerUnchanged,
                     kVSLDataProtectionClassUnset, "-[VSLGlobalConfiguration pendingUpdatesDirectory]",
                     "Failed to create updates dir at \"%@\": %@");
}

std::string VSLGlobalConfiguration::transientDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    return directory(transientDirectory_, cachesDirectory(), "Temp", kOwnerUnchanged, kVSLDataProtectionClassUnset,
                     "-[VSLGlobalConfiguration transientDirectory]", "Failed to create transient dir at \"%@\": %@");
}

std::optional<std::string> VSLGlobalConfiguration::legacyTransientBundleDirectory() const {
    std::string path = rootedPath("/private/var/stowaged/Library/Caches/com.tarrow.vesseld");
    if (VSLFileManager::defaultManager().itemExistsAtURL(path)) return path;
    return std::nullopt;
}

std::optional<std::string> VSLGlobalConfiguration::globalContainerBaseURLWithContentClass(
    VSLContainerClass containerClass, bool transient) {
    bool bundle = isBundleContainerClass(containerClass);
    if (!bundle && !isSystemContainerClass(containerClass)) return std::nullopt;
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    std::string base = !transient ? sharedContainersDirectory() : bundle ? transientBundleDirectory() : transientDirectory();
    return joinPath(base, containerClassDirectoryName(containerClass));
}

std::optional<std::string> VSLGlobalConfiguration::containerDirectoryURLForUserIdentity(
    const VSLUserIdentityRef& userIdentity, VSLContainerClass containerClass, bool transient) {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    if (auto url = globalContainerBaseURLWithContentClass(containerClass, transient)) {
        // System class directories keep whatever owner they were made with.
        uid_t owner = isBundleContainerClass(containerClass) ? deviceFacts().installerUID : kOwnerUnchanged;
        createLayoutDirectory(*url, owner, kVSLDataProtectionClassUnset,
                              "-[VSLGlobalConfiguration containerDirectoryURLForUserIdentity:contentClass:transient:]",
                              "Failed to create container dir at \"%@\": %@");
        return url;
    }
    auto perUser = getPerUserConfigurationForUserIdentity(userIdentity);
    if (!perUser) return std::nullopt;
    std::lock_guard<std::recursive_mutex> perUserLock(perUser->monitor());
    return perUser->containerDirectoryURLForContentClass(containerClass, transient);
}

std::optional<std::string> VSLGlobalConfiguration::stagingDirectoryURLForUserIdentity(
    const VSLUserIdentityRef& userIdentity, VSLContainerClass containerClass) {
    if (!isPerUserContainerClass(containerClass)) return stagingDirectory();
    auto perUser = getPerUserConfigurationForUserIdentity(userIdentity);
    if (!perUser) return std::nullopt;
    return perUser->stagingDirectory();
}

std::shared_ptr<VSLPerUserConfiguration> VSLGlobalConfiguration::getPerUserConfigurationForUserIdentity(
    const VSLUserIdentityRef& userIdentity) {
    if (!userIdentity) return nullptr;
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    auto& entry = perUserConfigurations_[userIdentity];
    if (!entry) entry = VSLPerUserConfiguration::initWithUserIdentity(userIdentity);
    return entry;
}

std::vector<std::string> VSLGlobalConfiguration::appUserDataItemNames() {
    return {"Documents", "Library", "tmp", "Tillbox"};
}

std::vector<std::string> VSLGlobalConfiguration::excludedFromAppUserData() { return {"SystemData"}; }

bool VSLGlobalConfiguration::migrationFileExistsWithName(const std::string& name) {
    return VSLFileManager::defaultManager().itemExistsAtURL(joinPath(libraryDirectory(), name));
}

bool VSLGlobalConfiguration::isInternalImage() {
    std::call_once(internalImageOnce_, [this] { isInternalImage_ = deviceFacts().internalBuild; });
    return isInternalImage_;
}

void VSLGlobalConfiguration::setIsInternalImage(bool isInternalImage) {
    // A value set before the first read is not overwritten by that read.
    std::call_once(internalImageOnce_, [] {});
    isInternalImage_ = isInternalImage;
}

}  // namespace vsl
