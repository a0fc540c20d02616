#include "Crash/CrashSupport.h"


#include <fstream>
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
    size_t previousRename = 0;
    for (size_t i = 0; i < steps.size(); i++) {
        if (steps[i].kind != "rename") continue;
        const TraceStep& r = steps[i];
        size_t since = previousRename;
        previousRename = i + 1;
        if (r.path.compare(0, volatilePrefix.size(), volatilePrefix) == 0) continue;
        std::string what = r.from + " -> " + r.path;
        if (r.from.empty()) {
            faults.push_back("rename without its source: " + r.path);
            continue;
        }
        // The source's last sync (or the write that made a file) must come after every
        // change made inside it.
        bool sourceSynced = false;
        const std::string inside = r.from + "/";
        for (size_t j = since; j < i; j++) {
            const TraceStep& s = steps[j];
            if ((s.kind == "fsync" || s.kind == "write") && s.path == r.from) sourceSynced = true;
            if (s.kind != "fsync" && s.path.compare(0, inside.size(), inside) == 0) sourceSynced = false;
        }
        if (!sourceSynced) faults.push_back("moved without syncing it after its last change: " + what);
        std::set<std::string> parents = {parentPath(r.from), parentPath(r.path)};
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
