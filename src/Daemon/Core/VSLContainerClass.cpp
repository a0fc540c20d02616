#include "Daemon/Core/VSLContainerClass.h"

#include <cstring>

namespace vsl {

namespace {

struct ClassRow {
    const char* directory;
    const char* shortName;
};

constexpr ClassRow kClasses[] = {
    {"Undefined", nullptr},
    {"Bundle/Application", "app"},
    {"Data/Application", "appData"},
    {"Bundle/PluginKitPlugin", "plugin"},
    {"Data/PluginKitPlugin", "pluginData"},
    {"Bundle/VPNPlugin", "vpn"},
    {"Data/VPNPlugin", "vpnData"},
    {"Shared/AppGroup", "appGroup"},
    {"Bundle/Framework", "framework"},
    {"Data/IPCService", "ipcService"},
    {"Data/InternalDaemon", "daemon"},
    {"Data/TempDir", "tempDir"},
    {"Data/System", "systemData"},
    {"Shared/SystemGroup", "systemGroup"},
    {"MAX", nullptr},
};

}  // namespace

bool isValidContainerClass(VSLContainerClass c) { return c >= 1 && c <= 13; }

bool isBundleContainerClass(VSLContainerClass c) { return c == 1 || c == 3 || c == 5 || c == 8; }

bool isSystemContainerClass(VSLContainerClass c) { return c == 12 || c == 13; }

bool isPerUserContainerClass(VSLContainerClass c) {
    return isValidContainerClass(c) && !isBundleContainerClass(c) && !isSystemContainerClass(c);
}

bool isGroupContainerClass(VSLContainerClass c) { return c == 7 || c == 13; }

bool isChildDataContainerClass(VSLContainerClass c) { return c == 4 || c == 6; }

const char* containerClassDirectoryName(VSLContainerClass c) {
    return c < std::size(kClasses) ? kClasses[c].directory : nullptr;
}

const char* containerClassShortName(VSLContainerClass c) {
    return c < std::size(kClasses) ? kClasses[c].shortName : nullptr;
}

VSLContainerClass containerClassForShortName(const char* name) {
    if (!name) return kVSLClassUndefined;
    for (VSLContainerClass c = 1; c <= 13; c++)
        if (std::strcmp(kClasses[c].shortName, name) == 0) return c;
    return kVSLClassUndefined;
}

void forEachPerUserContainerClass(const std::function<void(VSLContainerClass)>& work) {
    // Each call's locals are gone when it returns: the pool boundary is the call itself.
    for (VSLContainerClass c : {2, 4, 6, 7, 9, 10, 11}) work(c);
}

}  // namespace vsl
