#include "Daemon/Concurrency/VSLDataProtectionManager.h"

#include <cerrno>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Core/VSLContainerClass.h"
#include "Daemon/Service/VSLApplicationTerminationAssertion.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/Log.h"
#include "Platform/SystemRoot.h"

namespace vsl {

const VSLProtectionLevelName kVSLProtectionLevelNames[6] = {
    {"com.tarrow.protection.complete", 1},
    {"com.tarrow.protection.complete-unless-open", 2},
    {"com.tarrow.protection.complete-until-first-user-authentication", 3},
    {"com.tarrow.protection.none", 4},
    {"com.tarrow.protection.write-only", 2},
    {"com.tarrow.protection.complete-until-user-authentication", 3},
};

namespace {

constexpr const char* kContentProtectionClassKey = "com.tarrow.Stowage.ContentProtectionClass";


int32_t recordedClass(const VSLMetadata& metadata) {
    const Value* v = metadata.info() ? metadata.info()->find(kContentProtectionClassKey) : nullptr;
    return v && v->isNumber() ? static_cast<int32_t>(v->signedNumber().value_or(0)) : 0;
}

}  // namespace

VSLDataProtectionManager::VSLDataProtectionManager()
    : queue_(WorkQueue::serial("com.tarrow.Vesselry.ProtectionOperationFileQueue")) {}

VSLDataProtectionManager& VSLDataProtectionManager::defaultManager() {
    static VSLDataProtectionManager* const manager = new VSLDataProtectionManager();  // lives for the process
    return *manager;
}

void VSLDataProtectionManager::setDataProtectionOnDataContainerForContainerIdentity(
    const VSLContainerIdentityRef& identity, int32_t dataProtectionClass, bool isSecondOrThirdPartyApp,
    bool retryIfLocked, std::function<void(uint64_t)> completion) {
    auto complete = [&completion](uint64_t code) {
        if (completion) completion(code);
    };
    // The identifier names the pending-update file: that name must be one plain name
    // component, short enough to be a file name.
    if (!identity || !isPerUserContainerClass(identity->containerClass()) ||
        !VSLDataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(*identity)) {
        VSL_ERROR(kVSLErrorInvalidObject, nullptr, true, "Can't act on an invalid object: identity: %@", identity);
        return complete(kVSLErrorInvalidObject);
    }
    VSLErrorRef error;
    auto metadata = VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, true, &error);
    if (!metadata) {
        VSL_ERROR(kVSLErrorNotFound, error, true, "No Container with identity: %@", identity);
        return complete(kVSLErrorNotFound);
    }
    const int32_t oldClass = recordedClass(*metadata);
    if (dataProtectionClass == oldClass) {
        uint64_t code = kVSLSuccess;
        queue_->sync([&] {
            VSLErrorRef deleteError;
            if (!VSLDataProtectionChangeOperation::deleteUpdateFileWithContainerIdentity(*identity, &deleteError)) {
                LogWrite(kLogLevelError, "-[VSLDataProtectionManager setDataProtectionOnDataContainerForContainerIdentity:"
                                         "dataProtectionClass:isSecondOrThirdPartyApp:retryIfLocked:withCompletion:]",
                         "Failed to delete existing data protection update file: %@", deleteError);
                code = codeForError(deleteError, kVSLErrorRemoveFile);
            }
        });
        return complete(code);
    }
    if (dataProtectionClass == 2) {
        VSL_ERROR(kVSLErrorInvalidArgument, nullptr, true, "Data protection class %d is not allowed",
                  dataProtectionClass);
        return complete(kVSLErrorInvalidArgument);
    }
    if (isSecondOrThirdPartyApp && dataProtectionClass != 0 && dataProtectionClass != 1 &&
        dataProtectionClass != 3) {
        VSL_ERROR(kVSLErrorInvalidArgument, nullptr, true, "Data protection class %d is invalid for 2nd and 3rd party apps",
                  dataProtectionClass);
        return complete(kVSLErrorInvalidArgument);
    }
    const uint32_t changeType = dataProtectionClass < oldClass || (dataProtectionClass < 3 && oldClass == 0)
                                    ? kVSLChangeDirectories | kVSLChangeFiles | kVSLChangeNeverRaiseFiles
                                    : kVSLChangeDirectories;
    auto operation = VSLDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
        metadata, dataProtectionClass, retryIfLocked, changeType, queue_);
    VSLErrorRef writeError;
    if (!operation->writeToDiskWithError(&writeError)) {
        LogWrite(kLogLevelError, "-[VSLDataProtectionManager setDataProtectionOnDataContainerForContainerIdentity:"
                                 "dataProtectionClass:isSecondOrThirdPartyApp:retryIfLocked:withCompletion:]",
                 "Failed to write data protection update file to disk: %@", writeError);
        return complete(codeForError(writeError, kVSLErrorWriteFile));
    }
    _startDataProtectionChangeOperation(operation, std::move(completion));
}

void VSLDataProtectionManager::_startDataProtectionChangeOperation(
    const VSLDataProtectionChangeOperation::Ref& operation, std::function<void(uint64_t)> completion) {
    // Taken before the first retry, kept until the operation ends.
    auto assertion = std::make_shared<std::shared_ptr<VSLApplicationTerminationAssertion>>();
    const VSLMetadataRef metadata = operation->dataContainerMetadata();
    const int32_t newClass = operation->newDataProtectionClass();
    operation->setRetryStartBlock([assertion, metadata] {
        *assertion = VSLApplicationTerminationAssertion::initWithBundleIdentifier(metadata->identifier(),
                                                                                 kVSLTerminationReasonInstallation);
    });
    operation->setCompletionBlock([assertion, metadata, newClass, completion = std::move(completion)](
                                      bool wasLocked, const VSLErrorRef& error) {
        constexpr const char* fn = "-[VSLDataProtectionManager _startDataProtectionChangeOperation:withCompletion:]";
        uint64_t code = kVSLSuccess;
        if (error) {
            code = codeForError(error, kVSLErrorInvalidArgument);
            LogWrite(kLogLevelError, fn, "Failed to set data protection on container with identifier %@ at %@ to %d: %@",
                     metadata->identifier(), metadata->url(), newClass, error);
        }
        if (*assertion) {
            (*assertion)->invalidate();
            assertion->reset();
        }
        if (!error && !wasLocked) {
            uint64_t infoCode = kVSLSuccess;
            auto connection = VSLClientConnection::privilegedClientConnectionWithUserIdentity(metadata->userIdentity());
            connection->setInfoValue(Value::int64(newClass), Value::string(kContentProtectionClassKey),
                                     metadata->containerIdentity(), true, &infoCode);
            if (infoCode != kVSLSuccess)
                LogWrite(kLogLevelError, fn, "Failed to set protection class info for %@ at %@ to %d : %llu",
                         metadata->identifier(), metadata->url(), newClass, static_cast<unsigned long long>(infoCode));
        }
        if (completion) completion(code);
    });
    operation->performChangeOperation();
}

bool VSLDataProtectionManager::restartPendingDataProtectionOperationsWithError(VSLErrorRef* error) {
    constexpr const char* fn = "-[VSLDataProtectionManager restartPendingDataProtectionOperationsWithError:]";
    std::string directory = VSLGlobalConfiguration::sharedInstance()->pendingUpdatesDirectory();
    VSLErrorRef listError;
    auto items = VSLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, &listError);
    if (!items) {
        if (isPOSIXError(listError, ENOENT)) return true;
        LogWrite(kLogLevelError, fn, "Failed to get items at pendingUpdates URL %@ : %@", directory, listError);
        if (error) *error = listError;
        return false;
    }
    for (const auto& item : *items) {
        LogWrite(kLogLevelNotice, fn, "Found pending data protection operation at %@", item.path);
        VSLErrorRef readError;
        auto operation =
            VSLDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(item.path, queue_, &readError);
        if (!operation) {
            LogWrite(kLogLevelError, fn, "Failed to read data protection change operation at %@ : %@", item.path,
                     readError);
            continue;
        }
        const VSLMetadata& m = *operation->dataContainerMetadata();
        LogWrite(kLogLevelNotice, fn,
                 "Starting pending data protection update to protection class %d for user: %@, ID: %@, "
                 "containerClass: %llu",
                 operation->newDataProtectionClass(), m.userIdentity(), m.identifier(),
                 static_cast<unsigned long long>(m.containerClass()));
        _startDataProtectionChangeOperation(operation, nullptr);
    }
    return true;
}

int32_t VSLDataProtectionManager::intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
    const std::string& identifier) {
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    std::optional<Value> entitlements = mapping ? mapping->entitlementsForIdentifier(identifier) : std::nullopt;
    if (!entitlements) return 0;
    const std::string* value = nullptr;
    for (const char* key : {"com.tarrow.developer.default-data-protection", "data-protection-class",
                            "DataProtectionClass"}) {
        const Value* v = entitlements->find(key);
        if (v && v->stringValue()) {
            value = v->stringValue();
            break;
        }
    }
    if (!value) return 0;
    for (const auto& level : kVSLProtectionLevelNames)
        if (*value == level.name) return level.protectionClass;
    LogWrite(kLogLevelError, "-[VSLDataProtectionManager intendedDataProtectionClassBasedOnEntitlementsForIdentifier:]",
             "Unknown value for DataProtectionClass entitlement: %@; defaulting to class %d", *value, 0);
    return 0;
}

}  // namespace vsl
