// Container classes: 1..13, each with a two-component directory name and a short
// name (the key of the lookup entitlement). 0 and 14 are bounds, never valid.
#pragma once

#include <cstdint>
#include <functional>

namespace vsl {

using VSLContainerClass = uint64_t;

enum : VSLContainerClass {
    kVSLClassUndefined = 0,
    kVSLClassApplication = 1,
    kVSLClassApplicationData = 2,
    kVSLClassPlugin = 3,
    kVSLClassPluginData = 4,
    kVSLClassVPNPlugin = 5,
    kVSLClassVPNPluginData = 6,
    kVSLClassAppGroup = 7,
    kVSLClassFramework = 8,
    kVSLClassIPCService = 9,
    kVSLClassInternalDaemon = 10,
    kVSLClassTempDir = 11,
    kVSLClassSystemData = 12,
    kVSLClassSystemGroup = 13,
    kVSLClassMax = 14,
};

bool isValidContainerClass(VSLContainerClass c);  // 1..13
bool isBundleContainerClass(VSLContainerClass c);  // 1, 3, 5, 8
bool isSystemContainerClass(VSLContainerClass c);  // 12, 13
bool isPerUserContainerClass(VSLContainerClass c);  // 2, 4, 6, 7, 9, 10, 11
bool isGroupContainerClass(VSLContainerClass c);  // 7, 13
bool isChildDataContainerClass(VSLContainerClass c);  // 4, 6: identifier may be a plug-in's

// "Data/Application" etc.; "Undefined" / "MAX" for the bounds; nullptr past 14.
const char* containerClassDirectoryName(VSLContainerClass c);
// "appData" etc.; nullptr for the bounds and anything invalid.
const char* containerClassShortName(VSLContainerClass c);
// The class whose short name this is, or kVSLClassUndefined.
VSLContainerClass containerClassForShortName(const char* name);

// Calls `work` for 2, 4, 6, 7, 9, 10, 11 in that order; each pass's temporaries are
// released before the next.
void forEachPerUserContainerClass(const std::function<void(VSLContainerClass)>& work);

}  // namespace vsl
