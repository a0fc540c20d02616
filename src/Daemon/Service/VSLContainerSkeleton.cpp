#include "Daemon/Service/VSLContainerSkeleton.h"

#include "Daemon/Core/VSLErrorCodes.h"

namespace vsl {

namespace {

// Keep in step with docs/containers.md.
const std::vector<std::string> kDataContainer = {"Documents",           "Library",  "Library/Caches",
                                                 "Library/Preferences", "SystemData", "tmp"};
const std::vector<std::string> kGroupContainer = {"Library", "Library/Caches", "Library/Preferences"};
const std::vector<std::string> kTempDirContainer = {"tmp"};
const std::vector<std::string> kSystemDataContainer = {"Library", "Library/Caches", "Library/Preferences", "tmp"};
const std::vector<std::string> kSystemGroupContainer = {"Library", "Library/Caches", "Library/Preferences"};
const std::vector<std::string> kBundleContainer = {};  // filled by the installer

}  // namespace

std::optional<std::vector<std::string>> subdirectoriesForContainerClass(VSLContainerClass containerClass,
                                                                        uint64_t* code) {
    switch (containerClass) {
        case kVSLClassApplication:
        case kVSLClassPlugin:
        case kVSLClassVPNPlugin:
        case kVSLClassFramework: return kBundleContainer;
        case kVSLClassApplicationData:
        case kVSLClassPluginData:
        case kVSLClassVPNPluginData:
        case kVSLClassIPCService:
        case kVSLClassInternalDaemon: return kDataContainer;
        case kVSLClassAppGroup: return kGroupContainer;
        case kVSLClassTempDir: return kTempDirContainer;
        case kVSLClassSystemData: return kSystemDataContainer;
        case kVSLClassSystemGroup: return kSystemGroupContainer;
        default:
            if (code) *code = kVSLErrorUnexpectedClass;
            return std::nullopt;
    }
}

}  // namespace vsl
