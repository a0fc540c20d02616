// The operations the sweep kills at every durable step, each with what must hold of
// the container it acts on once the daemon has repaired the root.
#include <sys/stat.h>
#include <sys/xattr.h>

#include <fstream>
#include <future>
#include <thread>

#include "Client/VSLContainerInfo.h"
#include "Client/VSLProtection.h"
#include "Client/VSLReplaceContainer.h"
#include "Crash/CrashSweep.h"
#include "Platform/ProtectionClass.h"
#include "Platform/SystemRoot.h"
#include "Support/TempRoot.h"

namespace vsl::test {

namespace {

const char* const kNewFile = "crash-new.txt";  // written into a replacement before it goes in

bool exists(const std::string& path) {
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0;
}

// Directories below a container, relative to it, but the payload the preparation added.
std::set<std::string> skeleton(const std::string& container) {
    std::set<std::string> out;
    std::vector<std::string> pending = {""};
    while (!pending.empty()) {
        std::string relative = pending.back();
        pending.pop_back();
        for (const std::string& name : entriesOf(joinPath(container, relative))) {
            std::string child = relative.empty() ? name : joinPath(relative, name);
            struct stat st;
            if (::lstat(joinPath(container, child).c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) continue;
            if (child == "crash-payload") continue;
            out.insert(child);
            pending.push_back(child);
        }
    }
    return out;
}

const KnownContainer& bystanderOfClass(const PreparedRoot& p, uint64_t containerClass) {
    for (const auto& c : p.containers)
        if (c.containerClass == containerClass && !c.files.empty()) return c;
    return p.containers.front();
}

client::VSLContainerReference reference(const std::string& identifier, uint64_t containerClass, const std::string& uuid) {
    return {identifier, containerClass, Uuid::parse(uuid).value_or(Uuid{}), std::nullopt};
}

// A transient container of `identifier` with a file of its own: the replacement.
bool createReplacement(SweepRun& run, const std::string& identifier) {
    Value reply;
    if (!run.send(createRequest(identifier, 2, true), "new", &reply)) return false;
    const Value* u = reply.find("ReplyUUID");
    const Value* p = reply.find("ReplyPath");
    if (!run.acknowledged("new") || !u || !u->uuidValue() || !p || !p->stringValue()) return false;
    run.values["new"] = u->uuidValue()->string();
    std::ofstream(joinPath(*p->stringValue(), kNewFile)) << "new";
    return true;
}

Scenario create(const std::string& name, const std::string& identifier, uint64_t containerClass) {
    Scenario s;
    s.name = name;
    s.subjects = {identifier};
    s.drive = [=](SweepRun& run) {
        Value reply;
        if (!run.send(createRequest(identifier, containerClass), "create", &reply)) return;
        if (const Value* u = reply.find("ReplyUUID"); u && u->uuidValue()) run.values["uuid"] = u->uuidValue()->string();
    };
    s.check = [=](SweepRun& run) {
        Lookup l = lookUp(run, identifier, containerClass);
        if (run.acknowledged("create"))
            run.expect(l.code == 1 && l.uuid == run.values["uuid"], "an acknowledged creation was lost");
        if (l.code == 1) {
            const KnownContainer& model = bystanderOfClass(run.prepared, containerClass);
            run.expect(skeleton(run.daemon.at(l.path)) == skeleton(run.daemon.at(model.path)),
                       "the new container is not whole");
            run.expect(containersOnDisk(run, identifier) == 1, "one container of the identifier");
        } else {
            run.expect(l.code == 21, "lookup of the new container answers " + std::to_string(l.code));
            run.expect(containersOnDisk(run, identifier) == 0, "an absent container has a directory");
        }
    };
    return s;
}

// A container acted on by a removal: present and whole, or gone; gone once acknowledged.
void checkRemoved(SweepRun& run, const KnownContainer& c, const std::string& acknowledgement) {
    Lookup l = lookUp(run, c.identifier, c.containerClass);
    if (run.acknowledged(acknowledgement)) run.expect(l.code == 21, "an acknowledged removal of " + c.identifier + " was undone");
    if (l.code == 1)
        run.expect(l.uuid == c.uuid && l.path == c.path && holdsFiles(run, l.path, c), c.identifier + " is not whole");
    else
        run.expect(l.code == 21 && containersOnDisk(run, c.identifier) == 0, c.identifier + " half removed");
}

Scenario remove() {
    Scenario s;
    s.name = "Delete";
    s.subjects = {kTarget};
    s.drive = [](SweepRun& run) {
        if (!run.send(dict({{"Command", Value::uint64(10)},
                            {"Identifier", Value::string(kTarget)},
                            {"ContainerClass", Value::uint64(2)}}),
                      "delete"))
            return;
        run.send(dict({{"Command", Value::uint64(4)}}), "destroy");
    };
    s.check = [](SweepRun& run) { checkRemoved(run, *run.prepared.find(kTarget), "delete"); };
    return s;
}

Scenario stageSeveral() {
    Scenario s;
    s.name = "StageForDelete";
    for (int i = 1; i <= 3; i++) s.subjects.insert(kStagedPrefix + std::to_string(i));
    s.drive = [](SweepRun& run) {
        Array classes, uuids, identifiers, personas;
        for (int i = 1; i <= 3; i++) {
            const KnownContainer& c = *run.prepared.find(kStagedPrefix + std::to_string(i));
            classes.push_back(Value::uint64(c.containerClass));
            uuids.push_back(Value::uuid(*Uuid::parse(c.uuid)));
            identifiers.push_back(Value::string(c.identifier));
            personas.push_back(Value::string(""));
        }
        if (!run.send(dict({{"Command", Value::uint64(3)},
                            {"ContainerClassesArray", Value::array(classes)},
                            {"UUIDsArray", Value::array(uuids)},
                            {"IdentifiersArray", Value::array(identifiers)},
                            {"PersonaUniqueStringsArray", Value::array(personas)}}),
                      "stage"))
            return;
        run.send(dict({{"Command", Value::uint64(4)}}), "destroy");
    };
    s.check = [](SweepRun& run) {
        for (int i = 1; i <= 3; i++) checkRemoved(run, *run.prepared.find(kStagedPrefix + std::to_string(i)), "stage");
    };
    return s;
}

void driveReplace(SweepRun& run) {
    const KnownContainer& old = *run.prepared.find(kTarget);
    if (!createReplacement(run, kTarget)) return;
    run.send(client::replaceContainerRequest(reference(kTarget, 2, old.uuid), reference(kTarget, 2, run.values["new"])),
             "replace");
}

// Entirely old or entirely new, never absent; new once acknowledged.
void checkReplaced(SweepRun& run) {
    const KnownContainer& old = *run.prepared.find(kTarget);
    Lookup l = lookUp(run, kTarget, 2);
    if (l.code != 1) {
        run.fail("the replaced container is absent (code " + std::to_string(l.code) + ")");
        return;
    }
    const bool isNew = l.uuid != old.uuid;
    if (isNew)
        run.expect(exists(run.daemon.at(joinPath(l.path, kNewFile))) && holdsNoneOf(run, l.path, old),
                   "the new container is not whole");
    else
        run.expect(l.path == old.path && holdsFiles(run, l.path, old) && !exists(run.daemon.at(joinPath(l.path, kNewFile))),
                   "the old container is not whole");
    if (run.acknowledged("replace")) run.expect(isNew && l.uuid == run.values["new"], "an acknowledged replacement was undone");
    run.expect(containersOnDisk(run, kTarget) == 1, "one permanent container of the identifier");
}

Scenario replaceOld() {
    Scenario s;
    s.name = "ReplaceWithOld";
    s.subjects = {kTarget};
    s.drive = driveReplace;
    s.check = checkReplaced;
    return s;
}

Scenario replaceWithoutOld() {
    const std::string identifier = "com.example.promoted";
    Scenario s;
    s.name = "ReplaceWithoutOld";
    s.subjects = {identifier};
    s.drive = [=](SweepRun& run) {
        if (!createReplacement(run, identifier)) return;
        run.send(client::replaceContainerRequest(std::nullopt, reference(identifier, 2, run.values["new"])), "replace");
    };
    s.check = [=](SweepRun& run) {
        Lookup l = lookUp(run, identifier, 2);
        if (run.acknowledged("replace")) run.expect(l.code == 1 && l.uuid == run.values["new"], "an acknowledged promotion was undone");
        if (l.code == 1)
            run.expect(exists(run.daemon.at(joinPath(l.path, kNewFile))), "the promoted container is not whole");
        else
            run.expect(l.code == 21 && containersOnDisk(run, identifier) == 0, "a promotion half done");
    };
    return s;
}

Scenario wipe() {
    Scenario s;
    s.name = "Wipe";
    s.subjects = {kTarget};
    s.drive = [](SweepRun& run) {
        run.send(dict({{"Command", Value::uint64(12)},
                       {"Identifier", Value::string(kTarget)},
                       {"ContainerClass", Value::uint64(2)}}),
                 "wipe");
    };
    s.check = [](SweepRun& run) {
        const KnownContainer& old = *run.prepared.find(kTarget);
        Lookup l = lookUp(run, kTarget, 2);
        if (l.code != 1) {
            run.fail("the wiped container is absent (code " + std::to_string(l.code) + ")");
            return;
        }
        run.expect(l.uuid == old.uuid && l.path == old.path, "the wiped container lost its identity or place: " +
                                                                 l.uuid + " at " + l.path);
        const bool wiped = holdsNoneOf(run, l.path, old);
        run.expect(wiped || holdsFiles(run, l.path, old), "the wiped container is neither old nor new");
        if (run.acknowledged("wipe")) run.expect(wiped, "an acknowledged wipe was undone");
        run.expect(containersOnDisk(run, kTarget) == 1, "one permanent container of the identifier");
    };
    return s;
}

int classOf(const std::string& path) {
    char buf[16];
    ssize_t n = ::lgetxattr(path.c_str(), protectionClassAttributeName(), buf, sizeof buf);
    return n <= 0 ? 0 : std::atoi(std::string(buf, static_cast<size_t>(n)).c_str());
}

bool locked(const DaemonProcess& d) { return readFile(d.at("run/vesseld/keybag/lockstate")).starts_with("1"); }

void keybag(const DaemonProcess& d, const char* verb) {
    std::string out, err;
    runProgram({vesselctlPath(), "--root", d.root(), "keybag", verb}, &out, &err);
}

// A change to class 1 has completed, or its pending-update file completes it at the
// next unlock; it is never half applied without one.
void checkProtection(SweepRun& run) {
    const std::string pending = run.daemon.at(kPendingDirectory);
    const bool wasPending = !entriesOf(pending).empty();
    if (wasPending) {
        if (locked(run.daemon)) keybag(run.daemon, "unlock");
        for (int i = 0; i < 3000 && !entriesOf(pending).empty(); i++)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        run.expect(entriesOf(pending).empty(), "a pending protection change did not complete at unlock");
    }
    size_t atNew = 0, atOld = 0;
    for (const std::string& item : run.prepared.protectedItems) {
        int c = classOf(run.daemon.at(item));
        atNew += c == 1;
        atOld += c == 3;
    }
    const size_t all = run.prepared.protectedItems.size();
    if (wasPending || run.acknowledged("protect"))
        run.expect(atNew == all, "protection change incomplete: " + std::to_string(atNew) + " of " +
                                     std::to_string(all) + " items re-classed");
    else
        run.expect(atNew == all || atOld == all, "protection change half applied without a pending file: " +
                                                     std::to_string(atNew) + " of " + std::to_string(all));
}

Scenario protect() {
    Scenario s;
    s.name = "Protect";
    s.subjects = {kProtected};
    s.drive = [](SweepRun& run) {
        run.send(client::setDataProtectionRequest({kProtected, 2, 1, false, false}), "protect");
    };
    s.check = checkProtection;
    return s;
}

// Parked on a locked device, then resumed by an unlock.
Scenario protectLocked() {
    Scenario s;
    s.name = "ProtectParkedWhileLocked";
    s.subjects = {kProtected};
    s.setUp = [](DaemonProcess& d) { keybag(d, "lock"); };
    s.drive = [](SweepRun& run) {
        auto connection = run.connection;
        auto reply = std::async(std::launch::async, [connection] {
            return connection->sendRequest(client::setDataProtectionRequest({kProtected, 2, 1, false, true}),
                                           std::chrono::seconds(60));
        });
        const std::string log = run.daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log");
        for (int i = 0; i < 3000; i++) {
            if (reply.wait_for(std::chrono::milliseconds(5)) == std::future_status::ready) break;
            if (readFile(log).find("Retrying container protection update") != std::string::npos) {
                keybag(run.daemon, "unlock");
                break;
            }
        }
        auto r = reply.get();
        if (r.ok()) run.codes["protect"] = client::replyCode(r);
    };
    s.check = checkProtection;
    return s;
}

// A replacement killed once its old container sits in staging, with a deleted
// container on death row: the restart's recovery is killed in turn at each of its steps.
Scenario recovery() {
    Scenario s;
    s.name = "RecoveryKilled";
    const std::string deleted = std::string(kStagedPrefix) + "1";
    s.subjects = {kTarget, deleted};
    s.startupScope = true;
    s.drive = [=](SweepRun& run) {
        if (!run.send(dict({{"Command", Value::uint64(10)},
                            {"Identifier", Value::string(deleted)},
                            {"ContainerClass", Value::uint64(2)}}),
                      "delete"))
            return;
        driveReplace(run);
    };
    s.crashAt = [](const std::vector<TraceStep>& steps, const std::string& root) -> uint64_t {
        const std::string old = joinPath(root, preparedRoot().find(kTarget)->path);
        for (const TraceStep& step : steps)
            if (step.kind == "rename" && step.from == old) return step.n + 1;
        return 0;
    };
    s.check = [=](SweepRun& run) {
        checkReplaced(run);
        run.expect(lookUp(run, deleted, 2).code == 21, "a deletion acknowledged before the crash was undone");
    };
    return s;
}

}  // namespace

std::vector<Scenario> allScenarios() {
    return {create("CreateData", "com.example.new", 2),
            create("CreatePluginData", "com.example.plugin.new", 4),
            create("CreateGroup", "group.com.example.new", 7),
            create("CreateSystem", "com.example.system.new", 12),
            create("CreateSystemGroup", "systemgroup.com.example.new", 13),
            remove(),
            stageSeveral(),
            replaceOld(),
            replaceWithoutOld(),
            wipe(),
            protect(),
            protectLocked(),
            recovery()};
}

const Scenario& scenarioNamed(const std::string& name) {
    static const std::vector<Scenario> all = allScenarios();
    for (const Scenario& s : all)
        if (s.name == name) return s;
    static const Scenario none;
    return none;
}

}  // namespace vsl::test
