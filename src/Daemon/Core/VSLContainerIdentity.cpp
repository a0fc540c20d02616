#include "Daemon/Core/VSLContainerIdentity.h"

#include "Daemon/Core/VSLErrorCodes.h"
#include "Platform/Log.h"

namespace vsl {

namespace {
const char* const kInitName = "-[VSLContainerIdentity initWithUserIdentity:identifier:containerClass:error:]";
const char* const kConcreteInitName =
    "-[VSLConcreteContainerIdentity initWithUUID:userIdentity:identifier:containerClass:error:]";

bool fail(uint64_t* code, uint64_t value) {
    if (code) *code = value;
    return false;
}
}  // namespace

bool VSLContainerIdentity::initWithUserIdentity(const VSLUserIdentityRef& userIdentity, const Value& identifier,
                                                VSLContainerClass containerClass, uint64_t* code) {
    if (!userIdentity) {
        LogWrite(kLogLevelError, kInitName, "Invalid object: no user identity");
        return fail(code, kVSLErrorInvalidObject);
    }
    if (identifier.isNull()) {
        LogWrite(kLogLevelError, kInitName, "Invalid object: missing identifier");
        return fail(code, kVSLErrorMissingIdentifier);
    }
    // An empty name is no name: refused here, before a creation could leave a
    // container on disk that the cache then refuses.
    if (!identifier.stringValue() || identifier.stringValue()->empty()) {
        LogWrite(kLogLevelError, kInitName, "Invalid object: identifier = [%@]", identifier);
        return fail(code, kVSLErrorInvalidObject);
    }
    if (!isValidContainerClass(containerClass)) {
        LogWrite(kLogLevelError, kInitName, "Invalid object: container class = %llu", containerClass);
        return fail(code, kVSLErrorInvalidObject);
    }
    userIdentity_ = userIdentity;
    identifier_ = *identifier.stringValue();
    containerClass_ = containerClass;
    return true;
}

VSLContainerIdentityRef VSLContainerIdentity::containerIdentityWithUserIdentity(
    const VSLUserIdentityRef& userIdentity, const Value& identifier, VSLContainerClass containerClass,
    uint64_t* code) {
    std::shared_ptr<VSLContainerIdentity> id(new VSLContainerIdentity());
    if (!id->initWithUserIdentity(userIdentity, identifier, containerClass, code)) return nullptr;
    return id;
}

VSLContainerIdentityRef VSLContainerIdentity::containerIdentityWithUserIdentity(
    const VSLUserIdentityRef& userIdentity, const std::string& identifier, VSLContainerClass containerClass,
    uint64_t* code) {
    return containerIdentityWithUserIdentity(userIdentity, Value::string(identifier), containerClass, code);
}

VSLContainerIdentityRef VSLContainerIdentity::containerIdentityWithIdentifier(const std::string& identifier,
                                                                              VSLContainerClass containerClass,
                                                                              uint64_t* code) {
    if (VSLUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
        osLog(LogCategory::Unspecified, OSLogLevel::Fault,
              "Attempt to create a container identity without a user identity when one is required; identifier = "
              "[%@], class = %llu",
              identifier, containerClass);
        if (code) *code = kVSLErrorInvalidObject;
        return nullptr;
    }
    return containerIdentityWithUserIdentity(defaultUserIdentity(), identifier, containerClass, code);
}

bool VSLContainerIdentity::isEqualToContainerIdentity(const VSLContainerIdentity& other) const {
    return identifier_ == other.identifier_ && sameUserIdentity(userIdentity_, other.userIdentity_) &&
           containerClass_ == other.containerClass_;
}

bool VSLContainerIdentity::isEqual(const VSLContainerIdentity& other) const {
    return this == &other || isEqualToContainerIdentity(other);
}

size_t VSLContainerIdentity::hash() const {
    return std::hash<std::string>{}(identifier_) ^ (userIdentity_ ? userIdentity_->hash() : 0) ^
           static_cast<size_t>(containerClass_);
}

std::string VSLContainerIdentity::description() const {
    return formatLog("<%@: %p; userIdentity = %@, identifier = %@, class = %llu>", "VSLContainerIdentity",
                     static_cast<const void*>(this), userIdentity_ ? userIdentity_->shortDescription() : "(null)",
                     identifier_, containerClass_);
}

VSLConcreteContainerIdentityRef VSLConcreteContainerIdentity::containerIdentityWithUUID(
    const Value& uuid, const VSLUserIdentityRef& userIdentity, const Value& identifier,
    VSLContainerClass containerClass, uint64_t* code) {
    std::shared_ptr<VSLConcreteContainerIdentity> id(new VSLConcreteContainerIdentity());
    if (!id->initWithUserIdentity(userIdentity, identifier, containerClass, code)) return nullptr;
    auto u = uuid.uuidValue();
    if (!u) {
        LogWrite(kLogLevelError, kConcreteInitName, "Invalid object: uuid = [%@]", uuid);
        if (code) *code = kVSLErrorInvalidObject;
        return nullptr;
    }
    id->uuid_ = *u;
    return id;
}

VSLConcreteContainerIdentityRef VSLConcreteContainerIdentity::containerIdentityWithUUID(
    const Uuid& uuid, const VSLUserIdentityRef& userIdentity, const std::string& identifier,
    VSLContainerClass containerClass, uint64_t* code) {
    return containerIdentityWithUUID(Value::uuid(uuid), userIdentity, Value::string(identifier), containerClass,
                                     code);
}

bool VSLConcreteContainerIdentity::isEqualToConcreteContainerIdentity(
    const VSLConcreteContainerIdentity& other) const {
    return uuid_ == other.uuid_ && isEqualToContainerIdentity(other);
}

bool VSLConcreteContainerIdentity::isEqual(const VSLContainerIdentity& other) const {
    if (this == &other) return true;
    auto concrete = dynamic_cast<const VSLConcreteContainerIdentity*>(&other);
    return concrete && isEqualToConcreteContainerIdentity(*concrete);
}

size_t VSLConcreteContainerIdentity::hash() const { return VSLContainerIdentity::hash() ^ uuid_.hash(); }

std::string VSLConcreteContainerIdentity::description() const {
    return formatLog("<%@: %p; userIdentity = %@, identifier = %@, class = %llu, uuid = %@>",
                     "VSLConcreteContainerIdentity", static_cast<const void*>(this),
                     userIdentity_ ? userIdentity_->shortDescription() : "(null)", identifier_, containerClass_,
                     uuid_.string());
}

}  // namespace vsl
