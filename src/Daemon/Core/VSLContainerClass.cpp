#include "Daemon/Core/VSLContainerClass.h"

#include <unistd.h>

#include <cstring>
#include <mutex>

#include "Platform/DeviceFacts.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

// Skeletons: keep in step with docs/containers.md.
constexpr const char* kDataSkeleton[] = {"Documents",           "Library",    "Library/Caches",
                                         "Library/Preferences", "SystemData", "tmp"};
constexpr const char* kGroupSkeleton[] = {"Library", "Library/Caches", "Library/Preferences"};
constexpr const char* kTempDirSkeleton[] = {"tmp"};
constexpr const char* kSystemDataSkeleton[] = {"Library", "Library/Caches", "Library/Preferences", "tmp"};
constexpr const char* kSystemGroupSkeleton[] = {"Library", "Library/Caches", "Library/Preferences"};
constexpr std::span<const char* const> kNoSkeleton;  // bundles: the installer fills them

constexpr const char* kContainerExtension = "com.tarrow.sandbox.container";
constexpr const char* kGroupExtension = "com.tarrow.sandbox.application-group";

using F = VSLContainerFamily;
using O = VSLContainerOwner;
using P = VSLSkeletonProtection;
using G = VSLGroupScope;
constexpr VSLGroupType kApp = kVSLGroupTypeApplication;

constexpr VSLContainerClassTraits bound(const char* name) {
    return {name, nullptr, F::Invalid, false, false, true, O::None, O::None, 0, kNoSkeleton, P::None, 0, nullptr,
            G::None, kApp};
}
constexpr VSLContainerClassTraits bundle(const char* name, const char* shortName) {
    return {name, shortName, F::Bundle, false, false, false, O::Installer, O::Installer, 0755, kNoSkeleton, P::None,
            0,    nullptr,   G::None, kApp};
}
constexpr VSLContainerClassTraits data(const char* name, const char* shortName, bool childData,
                                       std::span<const char* const> skeleton, const char* extension) {
    return {name, shortName, F::Data, false, childData, true, O::User, O::User, 0755, skeleton, P::Container,
            1,    extension, G::None, kApp};
}

constexpr VSLContainerClassTraits kClasses[] = {
    bound("Undefined"),
    bundle("Bundle/Application", "app"),
    data("Data/Application", "appData", false, kDataSkeleton, kContainerExtension),
    bundle("Bundle/PluginKitPlugin", "plugin"),
    data("Data/PluginKitPlugin", "pluginData", true, kDataSkeleton, kContainerExtension),
    bundle("Bundle/VPNPlugin", "vpn"),
    data("Data/VPNPlugin", "vpnData", true, kDataSkeleton, kContainerExtension),
    {"Shared/AppGroup", "appGroup", F::Group, true, false, true, O::User, O::User, 0755, kGroupSkeleton, P::Container,
     2, kGroupExtension, G::EachUser, kVSLGroupTypeApplication},
    bundle("Bundle/Framework", "framework"),
    data("Data/IPCService", "ipcService", false, kDataSkeleton, nullptr),
    data("Data/InternalDaemon", "daemon", false, kDataSkeleton, kContainerExtension),
    data("Data/TempDir", "tempDir", false, kTempDirSkeleton, nullptr),
    {"Data/System", "systemData", F::System, false, false, false, O::SystemContainer, O::Nobody, 0,
     kSystemDataSkeleton, P::None, 4, nullptr, G::None, kApp},
    {"Shared/SystemGroup", "systemGroup", F::System, true, false, false, O::SystemContainer, O::Nobody, 0,
     kSystemGroupSkeleton, P::None, 8, nullptr, G::Device, kVSLGroupTypeSystem},
    bound("MAX"),
};
static_assert(std::size(kClasses) == kVSLClassMax + 1);

constexpr VSLContainerClassTraits kPastBounds = bound(nullptr);

constexpr uid_t kNobodyID = 4294967294u;  // the 32-bit pattern of -2

}  // namespace

const VSLContainerClassTraits& containerClassTraits(VSLContainerClass c) {
    return c < std::size(kClasses) ? kClasses[c] : kPastBounds;
}

bool isValidContainerClass(VSLContainerClass c) { return containerClassTraits(c).family != F::Invalid; }

bool isBundleContainerClass(VSLContainerClass c) { return containerClassTraits(c).family == F::Bundle; }

bool isSystemContainerClass(VSLContainerClass c) { return containerClassTraits(c).family == F::System; }

bool isPerUserContainerClass(VSLContainerClass c) {
    F family = containerClassTraits(c).family;
    return family == F::Data || family == F::Group;
}

bool isGroupContainerClass(VSLContainerClass c) { return containerClassTraits(c).group; }

bool isChildDataContainerClass(VSLContainerClass c) { return containerClassTraits(c).childData; }

VSLContainerClass groupContainerClassForType(VSLGroupType type) {
    for (VSLContainerClass c = 1; c < kVSLClassMax; c++)
        if (kClasses[c].groupScope != G::None && kClasses[c].groupType == type) return c;
    return kVSLClassAppGroup;
}

const char* containerClassDirectoryName(VSLContainerClass c) { return containerClassTraits(c).directoryName; }

const char* containerClassShortName(VSLContainerClass c) { return containerClassTraits(c).shortName; }

VSLContainerClass containerClassForShortName(const char* name) {
    if (!name) return kVSLClassUndefined;
    for (VSLContainerClass c = 1; c < kVSLClassMax; c++)
        if (std::strcmp(kClasses[c].shortName, name) == 0) return c;
    return kVSLClassUndefined;
}

namespace {

uint32_t ownerID(VSLContainerOwner owner, uint32_t userID) {
    switch (owner) {
        case O::Installer: return deviceFacts().installerUID;
        case O::SystemContainer: return deviceFacts().systemContainerUID;
        case O::Nobody: return kNobodyID;
        case O::User:
        case O::None: break;
    }
    return userID;
}

}  // namespace

uint32_t containerOwnerIDForClass(VSLContainerClass c, uint32_t userID) {
    return ownerID(containerClassTraits(c).owner, userID);
}

VSLSkeletonOwnership skeletonOwnershipForClass(VSLContainerClass c, uid_t userUID) {
    const auto& traits = containerClassTraits(c);
    VSLSkeletonOwnership result{ownerID(traits.skeletonOwner, userUID), traits.skeletonMode};
    const uid_t self = ::geteuid();
    if (traits.skeletonOwner != O::Nobody || self == 0) return result;
    static std::once_flag logged;
    std::call_once(logged, [&] {
        LogWrite(kLogLevelNotice, "skeletonOwnershipForClass",
                 "Running without root: system container subdirectories are owned by uid %u (mode 0700) instead of "
                 "uid %u (mode 0)",
                 self, result.owner);
    });
    return {self, 0700};
}

void forEachPerUserContainerClass(const std::function<void(VSLContainerClass)>& work) {
    // Each call's locals are gone when it returns: the pool boundary is the call itself.
    for (VSLContainerClass c = 1; c < kVSLClassMax; c++)
        if (isPerUserContainerClass(c)) work(c);
}

}  // namespace vsl
