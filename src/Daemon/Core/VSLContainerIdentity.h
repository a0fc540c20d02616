// Who a container belongs to (user identity), what it is called (identifier) and
// what kind it is (class); the concrete form adds the container's UUID. Immutable
// values shared by reference.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "Daemon/Core/VSLContainerClass.h"
#include "Daemon/Core/VSLUserIdentity.h"
#include "Platform/Value.h"

namespace vsl {

class VSLContainerIdentity;
class VSLConcreteContainerIdentity;
using VSLContainerIdentityRef = std::shared_ptr<const VSLContainerIdentity>;
using VSLConcreteContainerIdentityRef = std::shared_ptr<const VSLConcreteContainerIdentity>;

class VSLContainerIdentity {
public:
    virtual ~VSLContainerIdentity() = default;

    // `identifier` is taken as it arrived (null = absent) so that a non-string is
    // refused like the rest of the validation. `code` is written only on failure.
    static VSLContainerIdentityRef containerIdentityWithUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                                     const Value& identifier,
                                                                     VSLContainerClass containerClass,
                                                                     uint64_t* code);
    static VSLContainerIdentityRef containerIdentityWithUserIdentity(const VSLUserIdentityRef& userIdentity,
                                                                     const std::string& identifier,
                                                                     VSLContainerClass containerClass,
                                                                     uint64_t* code);
    // Bundle and system classes only: uses the default user identity.
    static VSLContainerIdentityRef containerIdentityWithIdentifier(const std::string& identifier,
                                                                   VSLContainerClass containerClass,
                                                                   uint64_t* code);

    const std::string& identifier() const { return identifier_; }
    VSLContainerClass containerClass() const { return containerClass_; }
    const VSLUserIdentityRef& userIdentity() const { return userIdentity_; }

    virtual bool isConcrete() const { return false; }
    // Same identifier, class and user identity. A plain identity asked about a
    // concrete one compares these fields only.
    bool isEqualToContainerIdentity(const VSLContainerIdentity& other) const;
    virtual bool isEqual(const VSLContainerIdentity& other) const;
    virtual size_t hash() const;
    virtual std::string description() const;

protected:
    VSLContainerIdentity() = default;
    // Runs the validation; false with `code` set on the first failure.
    bool initWithUserIdentity(const VSLUserIdentityRef& userIdentity, const Value& identifier,
                              VSLContainerClass containerClass, uint64_t* code);

    VSLUserIdentityRef userIdentity_;
    std::string identifier_;
    VSLContainerClass containerClass_ = 0;
};

class VSLConcreteContainerIdentity : public VSLContainerIdentity {
public:
    // `uuid` null or not a uuid is refused with code 11 after the base validation.
    static VSLConcreteContainerIdentityRef containerIdentityWithUUID(const Value& uuid,
                                                                     const VSLUserIdentityRef& userIdentity,
                                                                     const Value& identifier,
                                                                     VSLContainerClass containerClass,
                                                                     uint64_t* code);
    static VSLConcreteContainerIdentityRef containerIdentityWithUUID(const Uuid& uuid,
                                                                     const VSLUserIdentityRef& userIdentity,
                                                                     const std::string& identifier,
                                                                     VSLContainerClass containerClass,
                                                                     uint64_t* code);

    const Uuid& uuid() const { return uuid_; }
    bool isConcrete() const override { return true; }
    bool isEqualToConcreteContainerIdentity(const VSLConcreteContainerIdentity& other) const;
    bool isEqual(const VSLContainerIdentity& other) const override;
    size_t hash() const override;
    std::string description() const override;

private:
    VSLConcreteContainerIdentity() = default;
    Uuid uuid_;
};

// Hash/equality for unordered containers keyed by identities.
struct VSLContainerIdentityHash {
    size_t operator()(const VSLContainerIdentityRef& i) const { return i ? i->hash() : 0; }
};
struct VSLContainerIdentityEqual {
    bool operator()(const VSLContainerIdentityRef& a, const VSLContainerIdentityRef& b) const {
        return a == b || (a && b && a->isEqual(*b));
    }
};

}  // namespace vsl
