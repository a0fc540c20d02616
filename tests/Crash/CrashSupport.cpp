#include "Crash/CrashSupport.h"


#include <fstream>
#include <iterator>
#include <set>
#include <sstream>

#include "Platform/SystemRoot.h"

namespace vsl::test {

const char* const kIdentifier = "com.example.crash";

std::vector<TraceStep> readTrace(const std::string& file) {
    std::vector<TraceStep> steps;
    std::ifstream in(file);
    std::string line;
    while (std::getline(in, line)) {
        TraceStep s;
        std::istringstream fields(line);
        fields >> s.n >> s.kind;
        std::getline(fields >> std::ws, s.path);
        if (s.kind == "rename") {
            size_t arrow = s.path.find(" -> ");
            if (arrow != std::string::npos) {
                s.from = s.path.substr(0, arrow);
                s.path = s.path.substr(arrow + 4);
            }
        }
        steps.push_back(std::move(s));
    }
    return steps;
}

std::vector<std::string> auditRenames(const std::vector<TraceStep>& steps, const std::string& root) {
    std::vector<std::string> faults;
    const std::string volatilePrefix = joinPath(root, "run") + "/";
    // Items whose content is on disk as it stands: fsynced (or written, which syncs)
    // with nothing changed inside since. A rename carries the state to the new name.
    std::set<std::string> synced;
    // Items the trace never changed were synced by the process that made them.
    std::set<std::string> touched;
    auto touch = [&](std::string path) {
        for (; path.size() > root.size(); path = parentPath(path))
            if (!touched.insert(path).second) break;
    };
    auto isInside = [](const std::string& path, const std::string& directory) {
        return path.size() > directory.size() && path.compare(0, directory.size(), directory) == 0 &&
               path[directory.size()] == '/';
    };
    for (size_t i = 0; i < steps.size(); i++) {
        const TraceStep& s = steps[i];
        if (s.kind == "fsync") {
            synced.insert(s.path);
            continue;
        }
        if (s.kind == "write") synced.insert(s.path);
        const bool fromUntouched = s.kind == "rename" && !touched.count(s.from);
        touch(s.path);
        if (!s.from.empty()) touch(s.from);
        for (auto it = synced.begin(); it != synced.end();)
            it = isInside(s.path, *it) || (s.kind == "rename" && isInside(s.from, *it)) ? synced.erase(it) : std::next(it);
        if (s.kind != "rename") continue;
        const bool wasSynced = synced.erase(s.from) > 0 || fromUntouched;
        if (wasSynced) synced.insert(s.path);
        if (s.path.compare(0, volatilePrefix.size(), volatilePrefix) == 0) continue;
        std::string what = s.from + " -> " + s.path;
        if (s.from.empty()) {
            faults.push_back("rename without its source: " + s.path);
            continue;
        }
        if (!wasSynced) faults.push_back("moved without syncing it after its last change: " + what);
        std::set<std::string> parents = {parentPath(s.from), parentPath(s.path)};
        for (size_t j = i + 1; j < steps.size() && steps[j].kind != "rename"; j++)
            if (steps[j].kind == "fsync") parents.erase(steps[j].path);
        for (const std::string& p : parents) faults.push_back("directory " + p + " not synced after " + what);
    }
    return faults;
}

DaemonProcess::CtlResult createContainer(const DaemonProcess& d, const std::string& identifier) {
    return d.run(vesselctlPath(), {"createOrLookup", "Identifier=" + identifier, "ContainerClass=2",
                                   "CreateIfNecessary=true"});
}

DaemonProcess::CtlResult lookUpContainer(const DaemonProcess& d, const std::string& identifier) {
    return d.run(vesselctlPath(), {"createOrLookup", "Identifier=" + identifier, "ContainerClass=2",
                                   "CreateIfNecessary=false"});
}

DaemonProcess::CtlResult deleteContainer(const DaemonProcess& d, const std::string& identifier) {
    return d.run(vesselctlPath(), {"deleteContainer", "Identifier=" + identifier, "ContainerClass=2"});
}

DaemonProcess::CtlResult destroyDeathRow(const DaemonProcess& d) {
    return d.run(vesselctlPath(), {"deleteContainersOnDeathRow"});
}

std::string replyPath(const DaemonProcess::CtlResult& r) {
    const Value* v = r.reply.find("ReplyPath");
    return v && v->stringValue() ? *v->stringValue() : std::string();
}

}  // namespace vsl::test
