// The user-management service: the device's personas, read from
// etc/vesseld/personas.plist below the system root and watched for changes.
//
// The file is an array of dictionaries:
//   "PersonaType"          number, required: 0 personal, 1 enterprise, 2 unspecific
//   "KernelPersonaID"      number, required
//   "PersonaUniqueString"  string
//   "UID", "GID"           numbers: the POSIX user running in this persona
//   "HomeDirectory"        string, a path inside the system root (enterprise home)
//   "BundleIdentifiers"    array of strings
//   "Universal", "System"  booleans, only with type 2: what kind of unspecific persona
//   "KernelPersonaType"    number: the type the kernel's persona query reports
// A missing file means no personas. An unreadable, empty or malformed file (any entry
// of the wrong shape) is logged and the last good list stays in force.
//
// Linux has no per-thread persona, so the current persona of a context is derived
// from the caller: the persona with the given kernel persona ID when the caller names
// one; otherwise among the personas whose "UID" is the caller's uid the personal one,
// else the first in file order; none when no persona lists that uid.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace vsl {

struct PersonaAttributes {
    bool isPersonal = false;
    bool isEnterprise = false;
    bool isUniversal = false;
    bool isSystem = false;
    std::optional<std::string> uniqueString;
    uint32_t kernelPersonaID = 0;
    std::optional<uint32_t> kernelPersonaType;
    std::optional<uid_t> uid;
    std::optional<gid_t> gid;
    std::vector<std::string> bundleIdentifiers;
    std::optional<std::string> layoutPath;  // host path of the persona's home

    const char* kindName() const;  // "personal", "enterprise", "universal", "system", "unspecific"
    std::string description() const;
    bool operator==(const PersonaAttributes&) const = default;
};

using PersonaAttributesList = std::vector<PersonaAttributes>;
std::string describePersonaList(const PersonaAttributesList& list);

// Parses the contents of a personas file; none with a reason when malformed.
// "HomeDirectory" is taken below `rootPrefix` ("" for "/").
std::optional<PersonaAttributesList> parsePersonaList(const std::string& bytes, const std::string& rootPrefix,
                                                      std::string* error);

// Who is asking for its current persona.
struct PersonaContext {
    uid_t uid = 0;
    gid_t gid = 0;
    std::optional<uint32_t> kernelPersonaID;
};

class PersonaListObserver {
public:
    virtual ~PersonaListObserver() = default;
    virtual void personaListDidUpdate() = 0;
};

class UserManagement {
    struct Passkey {};

public:
    // Test hook: the list comes from here instead of the file; none = unreadable.
    using PersonaListSource = std::function<std::optional<PersonaAttributesList>()>;

    // The device's service over personas.plist of the current system root.
    static std::shared_ptr<UserManagement> create();
    // A service whose list comes from `source`; it watches no file (reload() stands in
    // for a change notification).
    static std::shared_ptr<UserManagement> createWithSource(PersonaListSource source);

    UserManagement(Passkey, std::string directory);
    ~UserManagement();  // stops the watcher
    UserManagement(const UserManagement&) = delete;
    UserManagement& operator=(const UserManagement&) = delete;

    std::optional<PersonaAttributes> currentPersona(const PersonaContext& context);
    // Reads the list afresh; on failure the last good list.
    PersonaAttributesList allPersonas();
    // Calls the observer's personaListDidUpdate whenever the list changes, from the
    // watcher thread, until the observer is gone. Returns the error, or none.
    std::optional<std::string> registerPersonaListObserver(std::weak_ptr<PersonaListObserver> observer,
                                                           const std::string& serviceName);
    // Reads the list now and tells the observers when it differs from what they last
    // heard. False when the list could not be read (the last good one stays).
    bool reload();

    struct State;  // shared with the watcher thread

private:
    std::shared_ptr<State> state_;
};

}  // namespace vsl
