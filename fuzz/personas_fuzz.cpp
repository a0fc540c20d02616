// Feeds arbitrary bytes to the personas.plist reader. Checks: a refusal says why; an
// accepted list is well formed, and the same list written back as a file reads back equal.
#include <cstdint>
#include <string>

#include "Platform/PropertyList.h"
#include "Platform/UserManagement.h"
#include "Platform/Value.h"

using namespace vsl;

namespace {

#define REQUIRE(cond) ((cond) ? (void)0 : __builtin_trap())

const std::string kRootPrefix = "/fuzz-root";

Value toFileEntry(const PersonaAttributes& p) {
    Dictionary d;
    d["PersonaType"] = Value::uint64(p.isPersonal ? 0 : p.isEnterprise ? 1 : 2);
    d["KernelPersonaID"] = Value::uint64(p.kernelPersonaID);
    if (p.kernelPersonaType) d["KernelPersonaType"] = Value::uint64(*p.kernelPersonaType);
    if (p.uid) d["UID"] = Value::uint64(*p.uid);
    if (p.gid) d["GID"] = Value::uint64(*p.gid);
    if (p.uniqueString) d["PersonaUniqueString"] = Value::string(*p.uniqueString);
    if (p.layoutPath) d["HomeDirectory"] = Value::string(p.layoutPath->substr(kRootPrefix.size()));
    if (p.isUniversal) d["Universal"] = Value::boolean(true);
    if (p.isSystem) d["System"] = Value::boolean(true);
    Array ids;
    for (const auto& id : p.bundleIdentifiers) ids.push_back(Value::string(id));
    if (!ids.empty()) d["BundleIdentifiers"] = Value::array(std::move(ids));
    return Value::dictionary(std::move(d));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string error;
    auto list = parsePersonaList(std::string(reinterpret_cast<const char*>(data), size), kRootPrefix, &error);
    if (!list) {
        REQUIRE(!error.empty());
        return 0;
    }
    Array entries;
    for (const PersonaAttributes& p : *list) {
        REQUIRE(!(p.isPersonal && p.isEnterprise));
        REQUIRE(!((p.isUniversal || p.isSystem) && (p.isPersonal || p.isEnterprise)));
        // A home never escapes the root's prefix by the way it is joined.
        REQUIRE(!p.layoutPath || p.layoutPath->starts_with(kRootPrefix + "/"));
        REQUIRE(!p.description().empty());
        entries.push_back(toFileEntry(p));
    }
    (void)describePersonaList(*list);

    auto bytes = encodeBinaryPropertyList(Value::array(std::move(entries)), nullptr);
    REQUIRE(bytes);
    auto again = parsePersonaList(*bytes, kRootPrefix, &error);
    REQUIRE(again && *again == *list);
    return 0;
}
