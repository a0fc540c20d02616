// Container classes: 1..13, each with a two-component directory name and a short
// name (the key of the lookup entitlement). 0 and 14 are bounds, never valid.
//
// Everything that depends on the class lives in one table of traits, so code asks
// "who owns it", "which skeleton", "which sandbox item" instead of testing numbers.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <span>

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

// Bundle 1, 3, 5, 8; per-user data 2, 4, 6, 9, 10, 11; per-user group 7; system 12, 13.
enum class VSLContainerFamily : uint8_t { Invalid, Bundle, Data, Group, System };

// Whose uid (and gid) a directory gets.
enum class VSLContainerOwner : uint8_t {
    None,             // the bounds
    Installer,        // InstallerUID of the device facts
    SystemContainer,  // SystemContainerUID of the device facts
    User,             // the container's user identity
    Nobody,           // 4294967294: system-container subdirectories
};

// Group classes: which entitlement names their groups (application groups, or system
// groups with the "systemgroup." prefix), and whose containers a group has.
enum VSLGroupType : int64_t { kVSLGroupTypeApplication = 0, kVSLGroupTypeSystem = 1 };
enum class VSLGroupScope : uint8_t {
    None,      // not a group class
    EachUser,  // one container per user: reconciled for every user that has a home
    Device,    // one per device: reconciled for the default user only
};

// Protection class of the skeleton: none (0), or the container's own (its info
// value, else what its entitlements ask for), names excluded from user data aside.
enum class VSLSkeletonProtection : uint8_t { None, Container };

struct VSLContainerClassTraits {
    const char* directoryName;  // "Data/Application"; "Undefined" / "MAX" for the bounds, none past them
    const char* shortName;      // "appData"; none for the bounds
    VSLContainerFamily family;
    bool group;                 // 7, 13
    bool childData;             // 4, 6: the identifier may be a plug-in's
    bool userIdentityRequired;  // false for bundle and system classes only
    VSLContainerOwner owner;    // the container's top directory and its class directory's users
    VSLContainerOwner skeletonOwner;
    mode_t skeletonMode;
    std::span<const char* const> skeleton;  // relative paths, parents before children
    VSLSkeletonProtection skeletonProtection;
    uint64_t sandboxItemType;           // kernel sandbox item kept for the class; 0: none
    const char* sandboxExtensionClass;  // token for sandboxed clients; none: no token
    VSLGroupScope groupScope;
    VSLGroupType groupType;  // the entitlement asked for a group owner's groups (application for the rest)
};

// Any number: past the bounds a row with no names and the invalid family.
const VSLContainerClassTraits& containerClassTraits(VSLContainerClass c);

bool isValidContainerClass(VSLContainerClass c);  // 1..13
bool isBundleContainerClass(VSLContainerClass c);  // 1, 3, 5, 8
bool isSystemContainerClass(VSLContainerClass c);  // 12, 13
bool isPerUserContainerClass(VSLContainerClass c);  // 2, 4, 6, 7, 9, 10, 11
bool isGroupContainerClass(VSLContainerClass c);  // 7, 13
bool isChildDataContainerClass(VSLContainerClass c);  // 4, 6: identifier may be a plug-in's
// The group class whose groups the type counts: 13 for system groups, else 7.
VSLContainerClass groupContainerClassForType(VSLGroupType type);

// "Data/Application" etc.; "Undefined" / "MAX" for the bounds; nullptr past 14.
const char* containerClassDirectoryName(VSLContainerClass c);
// "appData" etc.; nullptr for the bounds and anything invalid.
const char* containerClassShortName(VSLContainerClass c);
// The class whose short name this is, or kVSLClassUndefined.
VSLContainerClass containerClassForShortName(const char* name);

// The id (uid or gid alike) a container of the class is owned by: the installer's or
// the system container's from the device facts, else `userID`.
uint32_t containerOwnerIDForClass(VSLContainerClass c, uint32_t userID);

// Owner and mode of a new container's skeleton directories. A daemon without root
// cannot give away what it makes: an owner other than itself that comes from no
// configuration (the nobody owner of system-container subdirectories) becomes its
// own uid, with mode 0700 so that it can still fill them; logged once.
struct VSLSkeletonOwnership {
    uid_t owner;
    mode_t mode;
};
VSLSkeletonOwnership skeletonOwnershipForClass(VSLContainerClass c, uid_t userUID);

// Calls `work` for 2, 4, 6, 7, 9, 10, 11 in that order; each pass's temporaries are
// released before the next.
void forEachPerUserContainerClass(const std::function<void(VSLContainerClass)>& work);

}  // namespace vsl
