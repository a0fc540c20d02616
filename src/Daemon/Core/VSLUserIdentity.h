// The user and persona a container belongs to. Immutable; shared by reference.
// Equality and hashing use `identifier` only.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "Daemon/Core/VSLContainerClass.h"
#include "Platform/Value.h"

namespace vsl {

class VSLUserIdentity;
using VSLUserIdentityRef = std::shared_ptr<const VSLUserIdentity>;

enum VSLPersonaType : uint32_t {
    kVSLPersonaTypePersonal = 0,
    kVSLPersonaTypeEnterprise = 1,
    kVSLPersonaTypeUnspecific = 2,
};

// Uids below this are role users and never own containers.
constexpr uid_t kVSLFirstRegularUID = 501;

// What reading an identity's property list needs from the identity cache.
class VSLUserIdentityResolver {
public:
    virtual ~VSLUserIdentityResolver() = default;
    virtual VSLUserIdentityRef userIdentityForPersonaUniqueString(const std::optional<std::string>& unique,
                                                                  uid_t uid, gid_t gid) = 0;
    virtual VSLUserIdentityRef userIdentityForPersonalPersona(uid_t uid, gid_t gid) = 0;
};

class VSLUserIdentity {
public:
    // None for a role-user uid (below 501).
    static VSLUserIdentityRef create(uid_t uid, gid_t gid, std::string homeDirectoryURL,
                                     std::optional<std::string> personaUniqueString, uint32_t personaType,
                                     int32_t kernelPersonaID);
    // The legacy mobile identity: 501/501, personal, kernel persona ID 501.
    static VSLUserIdentityRef legacyMobile();

    // Version 2 written, versions 1 and 2 read. `code` is written only on failure.
    static VSLUserIdentityRef userIdentityWithPlist(const Value& plist, VSLUserIdentityResolver& cache,
                                                    uint64_t* code);
    Value plist() const;

    const std::string& homeDirectoryURL() const { return homeDirectoryURL_; }
    int32_t kernelPersonaID() const { return kernelPersonaID_; }
    uid_t posixUID() const { return uid_; }
    gid_t posixGID() const { return gid_; }
    uint32_t personaType() const { return personaType_; }
    const std::optional<std::string>& personaUniqueString() const { return personaUniqueString_; }
    const std::string& identifier() const { return identifier_; }

    bool isEnterprise() const { return personaType_ == kVSLPersonaTypeEnterprise; }
    bool isNoSpecificPersona() const { return personaType_ == kVSLPersonaTypeUnspecific; }
    bool isHomeDirectoryInCommonSandbox() const {
        return personaType_ == kVSLPersonaTypePersonal || personaType_ == kVSLPersonaTypeUnspecific;
    }

    uid_t posixUIDForContainerClass(VSLContainerClass c) const;
    gid_t posixGIDForContainerClass(VSLContainerClass c) const;
    static bool isUserIdentityRequiredForContainerClass(VSLContainerClass c);

    bool isEqual(const VSLUserIdentity& other) const { return identifier_ == other.identifier_; }
    size_t hash() const { return std::hash<std::string>{}(identifier_); }

    static const char* descriptionForPersonaType(uint32_t type);
    std::string description() const;
    std::string shortDescription() const;

private:
    VSLUserIdentity() = default;
    std::string homeDirectoryURL_;
    int32_t kernelPersonaID_ = 0;
    uid_t uid_ = 0;
    gid_t gid_ = 0;
    uint32_t personaType_ = 0;
    std::optional<std::string> personaUniqueString_;
    std::string identifier_;
};

// Null-safe equality of shared identities.
bool sameUserIdentity(const VSLUserIdentityRef& a, const VSLUserIdentityRef& b);

// Hash/equality by identifier, for sets and maps of identities.
struct VSLUserIdentityHash {
    size_t operator()(const VSLUserIdentityRef& u) const { return u ? u->hash() : 0; }
};
struct VSLUserIdentityEqual {
    bool operator()(const VSLUserIdentityRef& a, const VSLUserIdentityRef& b) const {
        return sameUserIdentity(a, b);
    }
};

}  // namespace vsl

namespace vsl {
// The identity of the user "mobile" (personal, no unique string); made once per
// process. None when the password database has no usable "mobile" user.
VSLUserIdentityRef defaultUserIdentity();
}  // namespace vsl
