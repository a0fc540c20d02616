#include "Daemon/Storage/VSLPerUserConfiguration.h"

#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLLayoutDirectory.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {
std::optional<std::string> appending(const std::optional<std::string>& base, const char* component) {
    if (!base) return std::nullopt;
    return joinPath(*base, component);
}
}  // namespace

std::shared_ptr<VSLPerUserConfiguration> VSLPerUserConfiguration::initWithUserIdentity(
    const VSLUserIdentityRef& userIdentity) {
    return std::shared_ptr<VSLPerUserConfiguration>(new VSLPerUserConfiguration(userIdentity));
}

VSLPerUserConfiguration::VSLPerUserConfiguration(VSLUserIdentityRef userIdentity)
    : userIdentity_(std::move(userIdentity)) {
    if (userIdentity_ && !userIdentity_->homeDirectoryURL().empty())
        userHomeDirectory_ = userIdentity_->homeDirectoryURL();
    else
        osLog(LogCategory::Unspecified, OSLogLevel::Fault, "Home directory cannot be nil: %@", userIdentity_);
}

std::optional<std::string> VSLPerUserConfiguration::directory(std::optional<std::string>& field,
                                                              const std::optional<std::string>& parent,
                                                              const char* component, const char* function,
                                                              const char* failureMessage) {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    if (!field) field = appending(parent, component);
    if (field) createLayoutDirectory(*field, userIdentity_->posixUID(), kVSLDataProtectionClassUnset, function,
                                     failureMessage);
    return field;
}

std::optional<std::string> VSLPerUserConfiguration::userBaseDirectory() {
    return directory(userBaseDirectory_, userHomeDirectory_, "Containers",
                     "-[VSLPerUserConfiguration userBaseDirectory]", "Failed to create user base dir at \"%@\": %@");
}

std::optional<std::string> VSLPerUserConfiguration::transientDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    return directory(transientDirectory_, userBaseDirectory(), "Temp", "-[VSLPerUserConfiguration transientDirectory]",
                     "Failed to create transient dir at \"%@\": %@");
}

std::optional<std::string> VSLPerUserConfiguration::stagingDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    return directory(stagingDirectory_, userBaseDirectory(), "Staging", "-[VSLPerUserConfiguration stagingDirectory]",
                     "Failed to create staging dir at \"%@\": %@");
}

std::optional<std::string> VSLPerUserConfiguration::libraryDirectory() {
    return directory(libraryDirectory_, userHomeDirectory_, "Library/Vesselry",
                     "-[VSLPerUserConfiguration libraryDirectory]", "Failed to create user library dir at \"%@\": %@");
}

std::optional<std::string> VSLPerUserConfiguration::containerDirectoryURLForContentClass(
    VSLContainerClass containerClass, bool transient) {
    static const char* const fn = "-[VSLPerUserConfiguration containerDirectoryURLForContentClass:transient:]";
    if (!isPerUserContainerClass(containerClass)) {
        LogWrite(kLogLevelError, fn, "Invalid class for a per user container directory: %llu",
                 static_cast<unsigned long long>(containerClass));
        return std::nullopt;
    }
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    auto url = appending(transient ? transientDirectory() : userBaseDirectory(),
                         containerClassDirectoryName(containerClass));
    if (url)
        createLayoutDirectory(*url, userIdentity_->posixUID(), kVSLDataProtectionClassUnset, fn,
                              "Failed to create container dir at \"%@\": %@");
    return url;
}

std::optional<std::string> VSLPerUserConfiguration::systemContainerBackupBaseDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    if (!systemContainerBackupBaseDirectory_)
        systemContainerBackupBaseDirectory_ = appending(userHomeDirectory_, "Library/Backup/SystemContainers");
    return systemContainerBackupBaseDirectory_;
}

std::optional<std::string> VSLPerUserConfiguration::systemContainerBackupDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    if (!systemContainerBackupDirectory_)
        systemContainerBackupDirectory_ = appending(systemContainerBackupBaseDirectory(), "Data");
    return systemContainerBackupDirectory_;
}

std::optional<std::string> VSLPerUserConfiguration::systemGroupContainerBackupDirectory() {
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    if (!systemGroupContainerBackupDirectory_)
        systemGroupContainerBackupDirectory_ = appending(systemContainerBackupBaseDirectory(), "Shared");
    return systemGroupContainerBackupDirectory_;
}

std::optional<std::string> VSLPerUserConfiguration::oldLoggingPath() {
    return appending(userHomeDirectory_, "Library/Logs/Vesselry");
}

bool VSLPerUserConfiguration::existsUserBaseDirectory() const {
    return userHomeDirectory_ && VSLFileManager::defaultManager().itemExistsAtURL(*userHomeDirectory_);
}

}  // namespace vsl
