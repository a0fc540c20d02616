#include "Daemon/Core/VSLUserIdentity.h"

#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/Log.h"

namespace vsl {

VSLUserIdentityRef VSLUserIdentity::create(uid_t uid, gid_t gid, std::string homeDirectoryURL,
                                           std::optional<std::string> personaUniqueString, uint32_t personaType,
                                           int32_t kernelPersonaID) {
    if (uid < kVSLFirstRegularUID) {
        LogWrite(kLogLevelError, "-[VSLUserIdentity initWithUID:GID:homeDirectoryURL:personaUniqueString:personaType:kernelPersonaID:]",
                 "Attempt to create a VSLUserIdentity object with a role user uid is not allowed: uid = %u, gid = %u",
                 uid, gid);
        return nullptr;
    }
    if (homeDirectoryURL.empty()) osLog(LogCategory::Unspecified, OSLogLevel::Fault, "Home directory cannot be nil");
    auto u = std::shared_ptr<VSLUserIdentity>(new VSLUserIdentity());
    u->homeDirectoryURL_ = std::move(homeDirectoryURL);
    u->kernelPersonaID_ = kernelPersonaID;
    u->uid_ = uid;
    u->gid_ = gid;
    u->personaType_ = personaType;
    u->personaUniqueString_ = std::move(personaUniqueString);
    // Enterprise personas are told apart by their unique string; everything else by uid.
    if (personaType == kVSLPersonaTypeEnterprise && u->personaUniqueString_)
        u->identifier_ = *u->personaUniqueString_;
    else
        u->identifier_ = std::to_string(uid);
    return u;
}

VSLUserIdentityRef VSLUserIdentity::legacyMobile() {
    return create(501, 501, VSLFileManager::homeDirectoryURLForPOSIXUID(501), std::nullopt, kVSLPersonaTypePersonal,
                  501);
}

namespace {

const char* const kVersion = "version";
const char* const kPosixUID = "posixUID";
const char* const kPosixGID = "posixGID";
const char* const kType = "type";
const char* const kPersonaUniqueString = "personaUniqueString";
const char* const kPersonaIdentifier = "personaIdentifier";
const char* const kPlistFunction = "-[VSLUserIdentity initWithPlist:cache:error:]";

// Reads the numeric keys, logging the first that is not a number.
bool readNumbers(const Value& plist, std::initializer_list<const char*> keys, uint64_t* out) {
    for (const char* key : keys) {
        const Value* v = plist.find(key);
        auto n = v ? v->unsignedNumber() : std::nullopt;
        if (!n) {
            LogWrite(kLogLevelError, kPlistFunction,
                     "Invalid user identity plist data. Expected number for %@, got %@. Data: %@", key,
                     v ? v->typeName() : "(null)", plist);
            return false;
        }
        *out++ = *n;
    }
    return true;
}

}  // namespace

VSLUserIdentityRef VSLUserIdentity::userIdentityWithPlist(const Value& plist, VSLUserIdentityResolver& cache,
                                                          uint64_t* code) {
    const Value* version = plist.find(kVersion);
    const std::string* vs = version ? version->stringValue() : nullptr;
    if (!vs || (*vs != "1" && *vs != "2")) return nullptr;

    if (*vs == "1") {
        uint64_t n[2];
        if (!readNumbers(plist, {kPosixUID, kPosixGID}, n)) {
            if (code) *code = kVSLErrorUserIdentityPlist;
            return nullptr;
        }
        uid_t uid = static_cast<uid_t>(n[0]);
        gid_t gid = static_cast<gid_t>(n[1]);
        const Value* pid = plist.find(kPersonaIdentifier);
        if (pid && pid->stringValue()) {
            if (auto u = cache.userIdentityForPersonaUniqueString(*pid->stringValue(), uid, gid)) return u;
        }
        return cache.userIdentityForPersonalPersona(uid, gid);
    }

    uint64_t n[3];
    if (!readNumbers(plist, {kPosixUID, kPosixGID, kType}, n)) {
        if (code) *code = kVSLErrorUserIdentityPlist;
        return nullptr;
    }
    if (n[2] >= 3) {
        LogWrite(kLogLevelError, kPlistFunction,
                 "Invalid user identity plist data. Expected persona type for %@, got %@. Data: %@", kType,
                 *plist.find(kType), plist);
        if (code) *code = kVSLErrorUserIdentityPlist;
        return nullptr;
    }
    uid_t uid = static_cast<uid_t>(n[0]);
    gid_t gid = static_cast<gid_t>(n[1]);
    const Value* unique = plist.find(kPersonaUniqueString);
    if (unique && unique->stringValue() && n[2] == kVSLPersonaTypeEnterprise) {
        auto u = cache.userIdentityForPersonaUniqueString(*unique->stringValue(), uid, gid);
        if (!u) {
            if (code) *code = kVSLSuccess;
            return nullptr;
        }
        if (!u->isEnterprise())
            LogWrite(kLogLevelError, kPlistFunction,
                     "Invalid user identity plist data. Expected %@ to be enterprise, but it was not. Data: %@",
                     u->shortDescription(), plist);
        return u;
    }
    return cache.userIdentityForPersonalPersona(uid, gid);
}

Value VSLUserIdentity::plist() const {
    Dictionary d{
        {kVersion, Value::string("2")},
        {kPosixUID, Value::uint64(uid_)},
        {kPosixGID, Value::uint64(gid_)},
        {kType, Value::uint64(personaType_)},
    };
    if (personaUniqueString_) d[kPersonaUniqueString] = Value::string(*personaUniqueString_);
    return Value::dictionary(std::move(d));
}

uid_t VSLUserIdentity::posixUIDForContainerClass(VSLContainerClass c) const {
    return containerOwnerIDForClass(c, uid_);
}

gid_t VSLUserIdentity::posixGIDForContainerClass(VSLContainerClass c) const {
    // The platform's installer and system uids serve as gids too.
    return containerOwnerIDForClass(c, gid_);
}

bool VSLUserIdentity::isUserIdentityRequiredForContainerClass(VSLContainerClass c) {
    return containerClassTraits(c).userIdentityRequired;
}

const char* VSLUserIdentity::descriptionForPersonaType(uint32_t type) {
    switch (type) {
        case kVSLPersonaTypePersonal: return "personal";
        case kVSLPersonaTypeEnterprise: return "enterprise";
        case kVSLPersonaTypeUnspecific: return "unspecific";
        default: return "unknown";
    }
}

std::string VSLUserIdentity::description() const {
    return formatLog(
        "<%@: %p; posixUID = %u, posixGID = %u, identifier = %@, homeDirectoryURL = %@, personaType = %@, "
        "personaUniqueString = %@, kernelPersonaID = %d>",
        "VSLUserIdentity", static_cast<const void*>(this), uid_, gid_, identifier_, homeDirectoryURL_,
        descriptionForPersonaType(personaType_), personaUniqueString_, kernelPersonaID_);
}

std::string VSLUserIdentity::shortDescription() const {
    return formatLog("<%@: %p; %u/%u/%@/%d/%d>", "VSLUserIdentity", static_cast<const void*>(this), uid_, gid_,
                     identifier_, personaType_, kernelPersonaID_);
}

bool sameUserIdentity(const VSLUserIdentityRef& a, const VSLUserIdentityRef& b) {
    if (a == b) return true;
    if (!a || !b) return false;
    return a->isEqual(*b);
}

}  // namespace vsl

#include <mutex>

#include "Platform/PasswordDatabase.h"

namespace vsl {

VSLUserIdentityRef defaultUserIdentity() {
    // Never destroyed: background queues may still ask for it while the process exits.
    static const VSLUserIdentityRef* identity = [] {
        auto mobile = passwordEntryForName("mobile");
        uid_t uid = mobile ? mobile->uid : 0;
        gid_t gid = mobile ? mobile->gid : 0;
        return new VSLUserIdentityRef(VSLUserIdentity::create(uid, gid,
                                                              VSLFileManager::homeDirectoryURLForPOSIXUID(uid),
                                                              std::nullopt, kVSLPersonaTypePersonal,
                                                              static_cast<int32_t>(uid)));
    }();
    return *identity;
}

}  // namespace vsl
