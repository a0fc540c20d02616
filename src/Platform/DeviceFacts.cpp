#include "Platform/DeviceFacts.h"

#include <unistd.h>

#include <fstream>
#include <iterator>
#include <memory>
#include <mutex>
#include <vector>

#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

std::string readAll(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

DeviceFacts load() {
    DeviceFacts f;
    f.installerUID = defaultInstallerUID();
    f.systemContainerUID = defaultSystemContainerUID();
    std::string bytes = readAll(rootedPath("/etc/vesseld/device.plist"));
    if (!bytes.empty()) {
        if (auto v = decodePropertyList(bytes.data(), bytes.size(), nullptr); v && v->isDictionary()) {
            auto flag = [&](const char* key, bool& out) {
                if (auto p = v->find(key); p && p->boolValue()) out = *p->boolValue();
            };
            flag("InternalBuild", f.internalBuild);
            flag("MultiUser", f.multiUser);
            flag("PersonasSupported", f.personasSupported);
            flag("EphemeralStorage", f.ephemeralStorage);
            if (auto p = v->find("InstallerUID"); p && p->unsignedNumber())
                f.installerUID = static_cast<uid_t>(*p->unsignedNumber());
            if (auto p = v->find("SystemContainerUID"); p && p->unsignedNumber())
                f.systemContainerUID = static_cast<uid_t>(*p->unsignedNumber());
            if (auto p = v->find("LogLevel")) {
                if (auto name = p->stringValue()) f.logLevel = logVerbosityNamed(*name);
                else if (auto n = p->signedNumber()) f.logLevel = logVerbosityForLevel(*n);
                if (!f.logLevel) LogWrite(kLogLevelError, "DeviceFacts", "device.plist: LogLevel %@ is not a log level; ignored", *p);
            }
            if (auto p = v->find("FeatureFlags"); p && p->dictionaryValue())
                for (const auto& [k, val] : *p->dictionaryValue())
                    if (val.boolValue()) f.featureFlags[k] = *val.boolValue();
        }
    }
    std::ifstream osr(rootedPath("/etc/os-release"));
    for (std::string line; std::getline(osr, line);) {
        if (line.rfind("BUILD_ID=", 0) != 0) continue;
        std::string v = line.substr(9);
        if (v.size() >= 2 && (v.front() == '"' || v.front() == '\'') && v.back() == v.front())
            v = v.substr(1, v.size() - 2);
        f.buildVersion = v;
    }
    return f;
}

std::mutex gMutex;
std::shared_ptr<const DeviceFacts> gFacts;

}  // namespace

uid_t defaultInstallerUID() { return ::geteuid() == 0 ? 33 : ::geteuid(); }

uid_t defaultSystemContainerUID() { return ::geteuid(); }

const DeviceFacts& deviceFacts() {
    std::lock_guard<std::mutex> g(gMutex);
    if (!gFacts) gFacts = std::make_shared<const DeviceFacts>(load());
    return *gFacts;  // kept alive: reloads replace but old snapshots are never freed
}

void reloadDeviceFacts() {
    std::lock_guard<std::mutex> g(gMutex);
    static std::vector<std::shared_ptr<const DeviceFacts>> retired;  // readers may hold references
    if (gFacts) retired.push_back(gFacts);
    gFacts = std::make_shared<const DeviceFacts>(load());
}

}  // namespace vsl
