#include "Platform/UserManagement.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <mutex>

#include "Platform/FileWatcher.h"
#include "Platform/Log.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

const char* const kPersonasFile = "personas.plist";
const char* const kReadFunction = "UserManagement::allPersonas";

std::optional<std::string> readWholeFile(const std::string& path, bool* missing, std::string* error) {
    *missing = false;
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        *missing = errno == ENOENT;
        *error = std::strerror(errno);
        return std::nullopt;
    }
    std::string bytes;
    char buf[16384];
    for (;;) {
        ssize_t n = ::read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) {
            *error = std::strerror(errno);
            ::close(fd);
            return std::nullopt;
        }
        if (n == 0) break;
        bytes.append(buf, static_cast<size_t>(n));
    }
    ::close(fd);
    return bytes;
}

// One persona dictionary; false with a reason when a key has the wrong shape.
bool parsePersona(const Value& entry, const std::string& rootPrefix, PersonaAttributes* out, std::string* error) {
    if (!entry.isDictionary()) {
        *error = "entry is not a dictionary";
        return false;
    }
    auto fail = [error](std::string why) {
        *error = std::move(why);
        return false;
    };
    auto number = [&](const char* key, bool required, std::optional<uint64_t>* n) {
        const Value* v = entry.find(key);
        if (!v) return required ? fail(std::string("missing ") + key) : true;
        *n = v->isNumber() ? v->unsignedNumber() : std::nullopt;
        if (!*n) return fail(std::string(key) + " is not a whole number in range");
        return true;
    };
    auto flag = [&](const char* key, bool* b) {
        const Value* v = entry.find(key);
        if (!v) return true;
        if (v->type() != Value::Type::Bool) return fail(std::string(key) + " is not a boolean");
        *b = *v->boolValue();
        return true;
    };
    auto text = [&](const char* key, std::optional<std::string>* s) {
        const Value* v = entry.find(key);
        if (!v) return true;
        if (!v->stringValue()) return fail(std::string(key) + " is not a string");
        *s = *v->stringValue();
        return true;
    };

    std::optional<uint64_t> type, personaID, uid, gid, kernelType;
    std::optional<std::string> home;
    PersonaAttributes p;
    if (!number("PersonaType", true, &type) || !number("KernelPersonaID", true, &personaID) ||
        !number("UID", false, &uid) || !number("KernelPersonaType", false, &kernelType) || !number("GID", false, &gid) ||
        !text("PersonaUniqueString", &p.uniqueString) || !text("HomeDirectory", &home) ||
        !flag("Universal", &p.isUniversal) || !flag("System", &p.isSystem))
        return false;
    if (*type > 2) return fail("PersonaType must be 0, 1 or 2");
    if ((p.isUniversal || p.isSystem) && *type != 2) return fail("Universal and System need PersonaType 2");
    p.isPersonal = *type == 0;
    p.isEnterprise = *type == 1;
    p.kernelPersonaID = static_cast<uint32_t>(*personaID);
    if (kernelType) p.kernelPersonaType = static_cast<uint32_t>(*kernelType);
    if (uid) p.uid = static_cast<uid_t>(*uid);
    if (gid) p.gid = static_cast<gid_t>(*gid);
    if (home) p.layoutPath = rootPrefix + (home->empty() || (*home)[0] != '/' ? "/" : "") + *home;
    if (const Value* ids = entry.find("BundleIdentifiers")) {
        if (!ids->arrayValue()) return fail("BundleIdentifiers is not an array");
        for (const Value& id : *ids->arrayValue()) {
            if (!id.stringValue()) return fail("BundleIdentifiers holds a non-string");
            p.bundleIdentifiers.push_back(*id.stringValue());
        }
    }
    *out = std::move(p);
    return true;
}

}  // namespace

const char* PersonaAttributes::kindName() const {
    if (isPersonal) return "personal";
    if (isEnterprise) return "enterprise";
    if (isUniversal) return "universal";
    if (isSystem) return "system";
    return "unspecific";
}

std::string PersonaAttributes::description() const {
    std::string ids;
    for (const auto& id : bundleIdentifiers) ids += (ids.empty() ? "" : ", ") + id;
    return formatLog("<persona %@; uniqueString = %@, kernelPersonaID = %u, uid = %@, home = %@, bundles = [%@]>",
                     kindName(), uniqueString, kernelPersonaID, uid ? std::to_string(*uid) : std::string("(none)"),
                     layoutPath, ids);
}

std::string describePersonaList(const PersonaAttributesList& list) {
    std::string s = "(";
    for (const auto& p : list) s += (s.size() > 1 ? ", " : "") + p.description();
    return s + ")";
}

std::optional<PersonaAttributesList> parsePersonaList(const std::string& bytes, const std::string& rootPrefix,
                                                      std::string* error) {
    std::string reason;
    auto root = decodePropertyList(bytes.data(), bytes.size(), &reason);
    if (!root) {
        if (error) *error = "not a property list: " + reason;
        return std::nullopt;
    }
    if (!root->arrayValue()) {
        if (error) *error = "the root is not an array";
        return std::nullopt;
    }
    PersonaAttributesList list;
    for (const Value& entry : *root->arrayValue()) {
        PersonaAttributes p;
        if (!parsePersona(entry, rootPrefix, &p, &reason)) {
            if (error) *error = "entry " + std::to_string(list.size()) + ": " + reason;
            return std::nullopt;
        }
        list.push_back(std::move(p));
    }
    return list;
}

struct UserManagement::State {
    std::function<std::optional<PersonaAttributesList>(std::string* error)> read;
    std::string directory;  // "" when the list comes from an injected source

    std::mutex mutex;  // guards everything below
    bool haveList = false;
    PersonaAttributesList lastGood;
    PersonaAttributesList announced;  // what the observers last heard
    std::vector<std::weak_ptr<PersonaListObserver>> observers;
    uint64_t watchToken = 0;  // the shared watcher's, once an observer registered

    // Keeps change notifications in the order the reads happened.
    std::mutex announceMutex;

    std::optional<PersonaAttributesList> fetch() {
        std::string error;
        auto list = read(&error);
        std::lock_guard g(mutex);
        if (!list) {
            LogWrite(kLogLevelError, kReadFunction, "Could not read the persona list %@: %@; keeping the last good list",
                     directory.empty() ? std::string("(injected)") : directory + "/" + kPersonasFile, error);
            return std::nullopt;
        }
        lastGood = *list;
        haveList = true;
        return list;
    }

    bool reload() {
        std::vector<std::shared_ptr<PersonaListObserver>> targets;  // released after the lock below
        std::lock_guard a(announceMutex);
        auto list = fetch();
        if (!list) return false;
        {
            std::lock_guard g(mutex);
            if (*list == announced) return true;
            announced = *list;
            std::erase_if(observers, [](const auto& w) { return w.expired(); });
            for (const auto& w : observers)
                if (auto o = w.lock()) targets.push_back(std::move(o));
        }
        for (const auto& o : targets) o->personaListDidUpdate();
        return true;
    }

};

std::shared_ptr<UserManagement> UserManagement::create() {
    std::string rootPrefix = systemRootIsSlash() ? std::string() : systemRoot();
    std::string directory = rootPrefix + "/etc/vesseld";
    auto um = std::make_shared<UserManagement>(Passkey{}, directory);
    um->state_->read = [path = joinPath(directory, kPersonasFile), rootPrefix](std::string* error)
        -> std::optional<PersonaAttributesList> {
        bool missing = false;
        auto bytes = readWholeFile(path, &missing, error);
        if (!bytes) {
            if (missing) return PersonaAttributesList{};  // no file: no personas
            return std::nullopt;
        }
        if (bytes->empty()) {
            *error = "empty file";
            return std::nullopt;
        }
        return parsePersonaList(*bytes, rootPrefix, error);
    };
    // What observers are told about is measured from the list at start.
    if (auto list = um->state_->fetch()) um->state_->announced = *list;
    return um;
}

std::shared_ptr<UserManagement> UserManagement::createWithSource(PersonaListSource source) {
    auto um = std::make_shared<UserManagement>(Passkey{}, std::string());
    um->state_->read = [source = std::move(source)](std::string* error) {
        auto list = source();
        if (!list) *error = "the source has no list";
        return list;
    };
    return um;
}

UserManagement::UserManagement(Passkey, std::string directory) : state_(std::make_shared<State>()) {
    state_->directory = std::move(directory);
}

UserManagement::~UserManagement() {
    if (state_->watchToken) FileWatcher::shared().unwatch(state_->watchToken);
}

std::optional<PersonaAttributes> UserManagement::currentPersona(const PersonaContext& context) {
    bool have;
    {
        std::lock_guard g(state_->mutex);
        have = state_->haveList;
    }
    if (!have) state_->fetch();
    std::lock_guard g(state_->mutex);
    const PersonaAttributes* match = nullptr;
    for (const auto& p : state_->lastGood) {
        if (context.kernelPersonaID) {
            if (p.kernelPersonaID == *context.kernelPersonaID) return p;
            continue;
        }
        if (p.uid != context.uid) continue;
        if (p.isPersonal) return p;
        if (!match) match = &p;
    }
    if (match) return *match;
    return std::nullopt;
}

PersonaAttributesList UserManagement::allPersonas() {
    if (auto list = state_->fetch()) return *list;
    std::lock_guard g(state_->mutex);
    return state_->lastGood;
}

std::optional<std::string> UserManagement::registerPersonaListObserver(std::weak_ptr<PersonaListObserver> observer,
                                                                       const std::string& serviceName) {
    std::lock_guard g(state_->mutex);
    if (!state_->directory.empty() && !state_->watchToken) {
        state_->watchToken = FileWatcher::shared().watch(state_->directory, kPersonasFile,
                                                         [s = std::weak_ptr<State>(state_)] {
                                                             if (auto held = s.lock()) held->reload();
                                                         });
        if (!state_->watchToken)
            return serviceName + ": cannot watch " + state_->directory + ": " + std::strerror(errno);
    }
    state_->observers.push_back(std::move(observer));
    return std::nullopt;
}

bool UserManagement::reload() { return state_->reload(); }

}  // namespace vsl
