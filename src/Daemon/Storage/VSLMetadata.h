// The in-memory record of one container and its metadata file
// ".com.tarrow.vesselry.metadata.plist": who owns the directory, of which class, for
// which user identity, under which UUID, plus optional info values and the name of
// the user-managed assets directory. The file is the ground truth the container
// cache is rebuilt from, so every read validates it strictly, in a fixed order.
// The record has no lock because a shared one never changes: it is built and filled
// in as a VSLMutableMetadataRef, then handed out as a VSLMetadataRef (const), and a
// change (new URL, UUID, info, flags) is made on a mutableCopy() that replaces it.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "Daemon/Core/VSLContainerIdentity.h"
#include "Daemon/Core/VSLError.h"
#include "Daemon/Core/VSLUserIdentity.h"
#include "Platform/Value.h"

namespace vsl {

class VSLMetadata;
class VSLUserIdentityCache;
using VSLMetadataRef = std::shared_ptr<const VSLMetadata>;
using VSLMutableMetadataRef = std::shared_ptr<VSLMetadata>;

// Keys of the metadata file.
extern const char* const kVSLMetadataIdentifierKey;         // "VSLMetadataIdentifier"
extern const char* const kVSLMetadataUUIDKey;               // "VSLMetadataUUID"
extern const char* const kVSLMetadataContentClassKey;       // "VSLMetadataContentClass"
extern const char* const kVSLMetadataVersionKey;            // "VSLMetadataVersion"
extern const char* const kVSLMetadataUserIdentityKey;       // "VSLMetadataUserIdentity"
extern const char* const kVSLMetadataInfoKey;               // "VSLMetadataInfo"
extern const char* const kVSLMetadataUserManagedAssetsKey;  // "VSLMetadataUserManagedAssetsDirName"
extern const char* const kVSLMetadataPersonaKey;            // "VSLMetadataPersona"

class VSLMetadata {
    struct Passkey {};

public:
    // None when the identity is none.
    static VSLMutableMetadataRef initWithContainerIdentity(const VSLConcreteContainerIdentityRef& identity,
                                                           std::optional<Value> info, std::string url,
                                                           std::optional<std::string> userManagedAssetsDirName);
    VSLMetadata(Passkey, const VSLConcreteContainerIdentity& identity, std::optional<Value> info, std::string url,
                std::optional<std::string> userManagedAssetsDirName);
    VSLMetadata(Passkey, const VSLMetadata& other) : VSLMetadata(other) {}

    // A private copy, all fields included, to change before it is shared in turn.
    VSLMutableMetadataRef mutableCopy() const;

    // Into `url`, through a staging file (fsynced) renamed into place, then the
    // container directory fsynced. Code 34 on failure.
    bool writeMetadataToDiskWithError(VSLErrorRef* error) const;
    bool writeMetadataToFileURL(const std::string& fileURL, VSLErrorRef* error) const;

    // Reads and validates the metadata file of the container directory `url`. Codes:
    // 12 unreadable (missing, torn, empty, not a dictionary, too large), 29 invalid
    // content. `cache` resolves user identities (default: the shared cache).
    static VSLMetadataRef readAndValidateMetadataAtUrl(const std::string& url,
                                                       const VSLUserIdentityRef& expectedUserIdentity,
                                                       bool checkClassPath, VSLErrorRef* error,
                                                       VSLUserIdentityCache* cache = nullptr);
    static VSLMetadataRef readAndValidateMetadataAtFileUrl(const std::string& fileURL,
                                                           const VSLUserIdentityRef& expectedUserIdentity,
                                                           bool checkClassPath, VSLErrorRef* error,
                                                           VSLUserIdentityCache* cache = nullptr);

    // The dictionary the file holds for this record.
    Value metadataDictionary() const;

    VSLContainerClass containerClass() const { return containerClass_; }
    const VSLUserIdentityRef& userIdentity() const { return userIdentity_; }
    const std::string& identifier() const { return identifier_; }

    const Uuid& uuid() const { return uuid_; }
    void setUuid(const Uuid& uuid) { uuid_ = uuid; }
    const std::string& url() const { return url_; }
    void setUrl(std::string url) { url_ = std::move(url); }
    const std::optional<std::string>& userManagedAssetsDirName() const { return userManagedAssetsDirName_; }
    void setUserManagedAssetsDirName(std::optional<std::string> name) { userManagedAssetsDirName_ = std::move(name); }
    const std::optional<Value>& info() const { return info_; }
    void setInfo(std::optional<Value> info) { info_ = std::move(info); }

    bool transient() const { return transient_; }
    void setTransient(bool transient) { transient_ = transient; }
    bool existed() const { return existed_; }
    void setExisted(bool existed) { existed_ = existed; }

    // None when the fields do not make a valid identity.
    VSLConcreteContainerIdentityRef containerIdentity() const;
    std::string description() const;

private:
    VSLMetadata(const VSLMetadata&) = default;
    VSLMetadata& operator=(const VSLMetadata&) = delete;

    bool transient_ = false;
    bool existed_ = false;
    const VSLContainerClass containerClass_;
    const VSLUserIdentityRef userIdentity_;
    const std::string identifier_;
    Uuid uuid_;
    std::string url_;
    std::optional<std::string> userManagedAssetsDirName_;
    std::optional<Value> info_;
};

}  // namespace vsl
