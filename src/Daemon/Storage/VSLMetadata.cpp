#include "Daemon/Storage/VSLMetadata.h"

#include <cstring>

#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/SystemRoot.h"

namespace vsl {

const char* const kVSLMetadataIdentifierKey = "VSLMetadataIdentifier";
const char* const kVSLMetadataUUIDKey = "VSLMetadataUUID";
const char* const kVSLMetadataContentClassKey = "VSLMetadataContentClass";
const char* const kVSLMetadataVersionKey = "VSLMetadataVersion";
const char* const kVSLMetadataUserIdentityKey = "VSLMetadataUserIdentity";
const char* const kVSLMetadataInfoKey = "VSLMetadataInfo";
const char* const kVSLMetadataUserManagedAssetsKey = "VSLMetadataUserManagedAssetsDirName";
const char* const kVSLMetadataPersonaKey = "VSLMetadataPersona";

namespace {

const char* const kMetadataVersion = "2";

// The class directory a container directory must sit in: three levels up, then the
// class's own two-component name.
std::string expectedClassDirectory(const std::string& containerDirectory, VSLContainerClass containerClass) {
    std::string base = parentPath(parentPath(parentPath(containerDirectory)));
    return joinPath(base, containerClassDirectoryName(containerClass));
}

}  // namespace

VSLMutableMetadataRef VSLMetadata::initWithContainerIdentity(const VSLConcreteContainerIdentityRef& identity,
                                                             std::optional<Value> info, std::string url,
                                                             std::optional<std::string> userManagedAssetsDirName) {
    if (!identity) return nullptr;
    return std::make_shared<VSLMetadata>(Passkey{}, *identity, std::move(info), std::move(url),
                                         std::move(userManagedAssetsDirName));
}

VSLMetadata::VSLMetadata(Passkey, const VSLConcreteContainerIdentity& identity, std::optional<Value> info,
                         std::string url, std::optional<std::string> userManagedAssetsDirName)
    : containerClass_(identity.containerClass()),
      userIdentity_(identity.userIdentity()),
      identifier_(identity.identifier()),
      uuid_(identity.uuid()),
      url_(std::move(url)),
      userManagedAssetsDirName_(std::move(userManagedAssetsDirName)),
      info_(std::move(info)) {}

VSLMutableMetadataRef VSLMetadata::mutableCopy() const { return std::make_shared<VSLMetadata>(Passkey{}, *this); }

Value VSLMetadata::metadataDictionary() const {
    Dictionary d;
    if (info_) d[kVSLMetadataInfoKey] = *info_;
    d[kVSLMetadataContentClassKey] = Value::uint64(containerClass_);
    if (VSLUserIdentity::isUserIdentityRequiredForContainerClass(containerClass_) && userIdentity_)
        d[kVSLMetadataUserIdentityKey] = userIdentity_->plist();
    d[kVSLMetadataIdentifierKey] = Value::string(identifier_);
    d[kVSLMetadataUUIDKey] = Value::string(uuid_.string());
    d[kVSLMetadataVersionKey] = Value::string(kMetadataVersion);
    if (userManagedAssetsDirName_) d[kVSLMetadataUserManagedAssetsKey] = Value::string(*userManagedAssetsDirName_);
    return Value::dictionary(std::move(d));
}

bool VSLMetadata::writeMetadataToDiskWithError(VSLErrorRef* error) const {
    return writeMetadataToFileURL(joinPath(url_, kVSLMetadataFileName), error);
}

bool VSLMetadata::writeMetadataToFileURL(const std::string& fileURL, VSLErrorRef* error) const {
    Value dictionary = metadataDictionary();
    auto staging = VSLGlobalConfiguration::sharedInstance()->stagingDirectoryURLForUserIdentity(userIdentity_,
                                                                                                 containerClass_);
    std::optional<std::string> stagingURL;
    if (staging) stagingURL = joinPath(*staging, "temp_metadata-" + uuid_.string() + ".plist");
    osLog(LogCategory::Metadata, OSLogLevel::Debug, "[%s] Writing metadata to [%@]: %@ => %@", __func__, fileURL,
          *this, dictionary);

    // The staged file is fsynced as it is written; the rename then makes it whole at once.
    VSLErrorRef writeError;
    if (!stagingURL || !VSL_writeToURL(dictionary, *stagingURL, kVSLWriteNoFileProtection, &writeError)) {
        auto e = VSL_ERROR(kVSLErrorWriteFile, writeError, true,
                           "Failed to write metadata dictionary to URL %@ : %@:%ld", stagingURL,
                           writeError ? writeError->domain : std::string(), writeError ? writeError->code : 0);
        if (error) *error = e;
        return false;
    }
    // The move syncs both directories.
    VSLErrorRef moveError;
    if (!VSLFileManager::defaultManager().moveItemAtURL(*stagingURL, fileURL, &moveError)) {
        auto e = VSL_ERROR(kVSLErrorWriteFile, moveError, true, "Failed to move metadata from staging: %@ to final: %@",
                           *stagingURL, fileURL);
        if (error) *error = e;
        return false;
    }
    return true;
}

VSLMetadataRef VSLMetadata::readAndValidateMetadataAtUrl(const std::string& url,
                                                         const VSLUserIdentityRef& expectedUserIdentity,
                                                         bool checkClassPath, VSLErrorRef* error,
                                                         VSLUserIdentityCache* cache) {
    return readAndValidateMetadataAtFileUrl(joinPath(url, kVSLMetadataFileName), expectedUserIdentity,
                                            checkClassPath, error, cache);
}

VSLMetadataRef VSLMetadata::readAndValidateMetadataAtFileUrl(const std::string& fileURL,
                                                             const VSLUserIdentityRef& expectedUserIdentity,
                                                             bool checkClassPath, VSLErrorRef* error,
                                                             VSLUserIdentityCache* cache) {
    auto fail = [&](VSLErrorRef e) -> VSLMetadataRef {
        if (error) *error = std::move(e);
        return nullptr;
    };
    const std::string containerDirectory = parentPath(fileURL);

    // 1. A torn, empty or oversized file is unreadable, never "no container".
    VSLErrorRef readError;
    auto plist = VSL_dictionaryWithContentsOfURL(fileURL, kVSLWriteNone, &readError);
    if (!plist) return fail(VSL_ERROR(kVSLErrorReadFile, readError, true, "Failed to read metadata at URL %@", fileURL));

    // 2-4.
    const Value* identifierValue = plist->find(kVSLMetadataIdentifierKey);
    if (!identifierValue || !identifierValue->isString())
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid metadata Identifier: %@ at %@",
                              identifierValue, fileURL));
    const std::string& identifier = *identifierValue->stringValue();
    const Value* uuidValue = plist->find(kVSLMetadataUUIDKey);
    if (!uuidValue || !uuidValue->isString())
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid metadata UUID String: %@ at %@",
                              uuidValue, fileURL));
    auto uuid = Uuid::parse(*uuidValue->stringValue());
    if (!uuid)
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid metadata UUID: %@ at %@", nullptr,
                              fileURL));

    // 5-6.
    const Value* classValue = plist->find(kVSLMetadataContentClassKey);
    if (!classValue || !classValue->isNumber())
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid metadata Class: %@ at %@", classValue,
                              fileURL));
    int64_t classNumber = classValue->signedNumber().value_or(0);
    if (classNumber < 1 || classNumber > 13)
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid metadata Content Class: %ld at %@",
                              classNumber, fileURL));
    const auto containerClass = static_cast<VSLContainerClass>(classNumber);

    // 7. User identity.
    VSLUserIdentityCache& identities = cache ? *cache : *VSLUserIdentitySharedCache::sharedInstance();
    VSLUserIdentityRef userIdentity;
    if (!VSLUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
        userIdentity = VSLUserIdentityCache::defaultUserIdentity();
    } else {
        uid_t uid = expectedUserIdentity ? expectedUserIdentity->posixUIDForContainerClass(containerClass) : 0;
        // Older files name only the owner's uid; a missing one is the expected owner.
        const Value* persona = plist->find(kVSLMetadataPersonaKey);
        uint64_t personaUID = uid;
        if (isPerUserContainerClass(containerClass) && persona) {
            auto stored = persona->unsignedNumber();
            if (!stored || *stored != uid)
                return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true,
                                      "Incorrect UserId: %@, expecting: %u for %@ at %@", persona, uid, identifier,
                                      fileURL));
            personaUID = *stored;
        }
        const Value* identityPlist = plist->find(kVSLMetadataUserIdentityKey);
        if (!identityPlist) {
            userIdentity = identities.userIdentityForPersonalPersona(static_cast<uid_t>(personaUID),
                                                                     static_cast<gid_t>(personaUID));
        } else {
            uint64_t code = kVSLSuccess;
            userIdentity = VSLUserIdentity::userIdentityWithPlist(*identityPlist, identities, &code);
            if (!userIdentity)
                return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true,
                                      "Invalid metadata User Identity: %@ for %@ at %@: %llu", identityPlist,
                                      identifier, fileURL, code));
            if (!sameUserIdentity(userIdentity, expectedUserIdentity))
                return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true,
                                      "Incorrect User Identity: %@, expecting: %@ for %@ at %@: %llu", userIdentity,
                                      expectedUserIdentity, identifier, fileURL, code));
        }
    }

    // 8-9.
    const Value* info = plist->find(kVSLMetadataInfoKey);
    if (info && !info->isDictionary())
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid metadata Info: %@ at %@", info,
                              fileURL));
    const Value* assets = plist->find(kVSLMetadataUserManagedAssetsKey);
    if (assets && !assets->isString())
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true,
                              "Invalid metadata User Managed Dir Name String: %@ at %@", assets, fileURL));

    // 10.
    if (checkClassPath) {
        std::string expected = expectedClassDirectory(containerDirectory, containerClass);
        if (parentPath(containerDirectory) != expected)
            return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Invalid metadata-URLs should match: %@ : %@",
                                  fileURL, expected));
    }

    // 11-12.
    uint64_t code = kVSLSuccess;
    auto identity =
        VSLConcreteContainerIdentity::containerIdentityWithUUID(*uuid, userIdentity, identifier, containerClass, &code);
    if (!identity)
        return fail(VSL_ERROR(kVSLErrorInvalidContent, nullptr, true, "Could not create user identity from %@: %llu",
                              fileURL, code));
    auto metadata = initWithContainerIdentity(identity, info ? std::optional<Value>(*info) : std::nullopt,
                                              containerDirectory,
                                              assets ? std::optional<std::string>(*assets->stringValue()) : std::nullopt);
    osLog(LogCategory::Metadata, OSLogLevel::Debug, "[%s] Read metadata from [%@]: %@ <= %@", __func__, fileURL,
          *metadata, *plist);
    return metadata;
}

VSLConcreteContainerIdentityRef VSLMetadata::containerIdentity() const {
    uint64_t code = kVSLSuccess;
    return VSLConcreteContainerIdentity::containerIdentityWithUUID(uuid_, userIdentity_, identifier_, containerClass_,
                                                                   &code);
}

std::string VSLMetadata::description() const {
    return formatLog(
        "<%@: %p; userIdentity = %@, uuid = %@, containerClass = %llu, identifier = %@, info = %@, url = %@, "
        "userManagedAssetsDirName = %@>",
        "VSLMetadata", static_cast<const void*>(this), userIdentity_, uuid_.string(), containerClass_, identifier_,
        info_, url_, userManagedAssetsDirName_);
}

}  // namespace vsl
