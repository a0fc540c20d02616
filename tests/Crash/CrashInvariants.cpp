// What a root must look like once the daemon has repaired it after any crash: the
// containers nobody acted on are found whole under their UUIDs, nothing is left in
// staging, Replace or death row, every class-directory entry is a whole container
// and no daemon property-list file is torn.
#include <sys/stat.h>

#include "Client/VSLContainerInfo.h"
#include "Crash/CrashSweep.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/SystemRoot.h"
#include "Support/TempRoot.h"

namespace vsl::test {

const char* const kDeathRow = "private/var/root/Library/Caches/com.tarrow.vesseld/Dead";
const char* const kReplaceDirectory = "private/var/root/Library/Vesselry/Replace";
const char* const kPendingDirectory = "private/var/root/Library/Vesselry/PendingUpdates";

namespace {

const char* const kStagingDirectories[] = {
    "private/var/mobile/Containers/Staging",
    "private/var/root/Library/Caches/com.tarrow.vesseld/Staging",
};
// Parents of class directories: every directory below them holds containers only.
const char* const kClassDirectoryParents[] = {
    "private/var/mobile/Containers/Data",   "private/var/mobile/Containers/Shared",
    "private/var/mobile/Containers/Temp/Data", "private/var/containers/Data",
    "private/var/containers/Shared",        "private/var/containers/Bundle",
};

bool isDirectory(const std::string& path) {
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

std::optional<Value> readPropertyList(const std::string& path) {
    VSLErrorRef error;
    return VSL_dictionaryWithContentsOfURL(path, 0, &error);
}

}  // namespace

bool SweepRun::send(const Value& request, const std::string& name, Value* reply) {
    auto r = connection ? connection->sendRequest(request, std::chrono::seconds(30)) : client::VSLReply{};
    if (!r.ok()) {
        lastError = connection ? client::statusName(r.status) + std::string(": ") + r.error : "not connected";
        return false;
    }
    codes[name] = client::replyCode(r);
    if (reply) *reply = r.body;
    return true;
}

bool SweepRun::acknowledged(const std::string& name) const {
    auto it = codes.find(name);
    return it != codes.end() && it->second == 1;
}

Lookup lookUp(SweepRun& run, const std::string& identifier, uint64_t containerClass) {
    Lookup l;
    Value request = createRequest(identifier, containerClass, false, false);
    Value reply;
    if (!run.send(request, "lookup " + identifier, &reply)) {
        std::string log = readFile(run.daemon.at("vesseld.stderr"));
        const int status = run.daemon.waitForExit(std::chrono::milliseconds(0));
        run.fail("no answer to a lookup of " + identifier + " (" + run.lastError + "); the daemon " +
                 (status < 0 ? "runs" : "exited with " + std::to_string(status)) + "; its output ends: " +
                 log.substr(log.size() > 400 ? log.size() - 400 : 0));
        return l;
    }
    l.code = run.codes["lookup " + identifier];
    if (const Value* u = reply.find("ReplyUUID"); u && u->uuidValue()) l.uuid = u->uuidValue()->string();
    if (const Value* p = reply.find("ReplyPath"); p && p->stringValue()) {
        const std::string& root = run.daemon.root();
        l.path = p->stringValue()->compare(0, root.size() + 1, root + "/") == 0 ? p->stringValue()->substr(root.size() + 1)
                                                                                 : *p->stringValue();
    }
    return l;
}

bool holdsFiles(const SweepRun& run, const std::string& path, const KnownContainer& c) {
    for (const auto& [name, text] : c.files)
        if (readFile(run.daemon.at(joinPath(path, name))) != text) return false;
    return true;
}

bool holdsNoneOf(const SweepRun& run, const std::string& path, const KnownContainer& c) {
    for (const auto& [name, text] : c.files) {
        struct stat st;
        if (::lstat(run.daemon.at(joinPath(path, name)).c_str(), &st) == 0) return false;
    }
    return true;
}

namespace {

// Every class-directory entry must be a whole container: one with readable metadata.
std::map<std::string, int> scanClassDirectories(SweepRun& run) {
    std::map<std::string, int> found;
    for (const char* parent : kClassDirectoryParents) {
        for (const std::string& classDirectory : entriesOf(run.daemon.at(parent))) {
            std::string relative = joinPath(parent, classDirectory);
            if (!isDirectory(run.daemon.at(relative))) continue;
            for (const std::string& name : entriesOf(run.daemon.at(relative))) {
                auto metadata = readPropertyList(run.daemon.at(joinPath(joinPath(relative, name), kVSLMetadataFileName)));
                const Value* identifier = metadata ? metadata->find(kVSLMetadataIdentifierKey) : nullptr;
                const Value* uuid = metadata ? metadata->find(kVSLMetadataUUIDKey) : nullptr;
                if (!identifier || !identifier->stringValue() || !uuid || !uuid->stringValue()) {
                    run.fail("class-directory entry without valid metadata: " + joinPath(relative, name));
                    continue;
                }
                found[*identifier->stringValue() + " in " + relative]++;
            }
        }
    }
    return found;
}

}  // namespace

int containersOnDisk(const SweepRun& run, const std::string& identifier, bool transient) {
    int count = 0;
    const std::string prefix = identifier + " in ";
    for (const auto& [what, n] : run.onDisk)
        if (what.compare(0, prefix.size(), prefix) == 0 && (transient || what.find("/Temp/") == std::string::npos))
            count += n;
    return count;
}

void checkCommonInvariants(SweepRun& run, const std::set<std::string>& subjects) {
    for (const KnownContainer& c : run.prepared.containers) {
        if (subjects.count(c.identifier)) continue;
        Lookup l = lookUp(run, c.identifier, c.containerClass);
        if (l.code != 1) {
            run.fail("untouched container lost: " + c.identifier + " (code " + std::to_string(l.code) + ")");
            continue;
        }
        run.expect(l.uuid == c.uuid, "untouched container " + c.identifier + " answers to another UUID");
        run.expect(l.path == c.path, "untouched container " + c.identifier + " moved to " + l.path);
        run.expect(holdsFiles(run, l.path, c), "untouched container " + c.identifier + " lost files");
    }
    for (const char* staging : kStagingDirectories)
        for (const std::string& name : entriesOf(run.daemon.at(staging))) run.fail("left in staging: " + name);
    for (const std::string& name : entriesOf(run.daemon.at(kReplaceDirectory))) run.fail("left in Replace: " + name);
    for (const std::string& name : entriesOf(run.daemon.at(kDeathRow))) run.fail("left on death row: " + name);
    run.onDisk = scanClassDirectories(run);
    for (const auto& [what, count] : run.onDisk) run.expect(count == 1, std::to_string(count) + " containers of " + what);
    for (const std::string& name : entriesOf(run.daemon.at(kPendingDirectory))) {
        auto pending = readPropertyList(joinPath(run.daemon.at(kPendingDirectory), name));
        run.expect(name[0] != '.' && pending && pending->find("VSLDataOperationInternalID"),
                   "pending-update file torn or left over: " + name);
    }
    for (const std::string& name : entriesOf(run.daemon.at("private/var/root/Library/Vesselry")))
        if (name.size() > 6 && name.compare(name.size() - 6, 6, ".plist") == 0)
            run.expect(readPropertyList(run.daemon.at(joinPath("private/var/root/Library/Vesselry", name))).has_value(),
                       "status file torn: " + name);
}

}  // namespace vsl::test
