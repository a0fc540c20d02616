// Feeds arbitrary bytes to the code-signing policy store's reader as the contents of one
// of its files. Checks: every record taken is well formed, and the records written back
// as a file read back the same.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "Platform/CodeSigningPolicy.h"
#include "Platform/PropertyList.h"
#include "Platform/Value.h"

using namespace vsl;

namespace {

#define REQUIRE(cond) ((cond) ? (void)0 : __builtin_trap())

const std::string kFile = "/fuzz/code-signatures/a.plist";

Value toFileRecord(const CodeSigningRecord& r) {
    Dictionary d;
    d["Executable"] = Value::string(r.executable);
    d["SigningIdentifier"] = Value::string(r.signingIdentifier);
    d["Entitlements"] = Value::dictionary(r.entitlements);
    d["Sandboxed"] = Value::boolean(r.sandboxed);
    return Value::dictionary(std::move(d));
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    ::setenv("VESSELD_OSLOG", "off", 1);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    auto records = parsePolicyFile(std::string(reinterpret_cast<const char*>(data), size), kFile);
    Array written;
    for (const CodeSigningRecord& r : records) {
        REQUIRE(!r.signingIdentifier.empty());
        REQUIRE(r.executable.starts_with('/'));
        REQUIRE(r.sourceFile == kFile);
        written.push_back(toFileRecord(r));
    }
    if (records.empty()) return 0;

    auto bytes = encodeBinaryPropertyList(Value::array(written), nullptr);
    REQUIRE(bytes);
    auto again = parsePolicyFile(*bytes, kFile);
    REQUIRE(again.size() == records.size());
    for (size_t i = 0; i < again.size(); i++) {
        REQUIRE(again[i].executable == records[i].executable);
        REQUIRE(again[i].signingIdentifier == records[i].signingIdentifier);
        REQUIRE(again[i].sandboxed == records[i].sandboxed);
        // Keys only: a NaN equals nothing, and a date may move by a microsecond on each
        // trip through the property-list library's (seconds, microseconds) form.
        REQUIRE(again[i].entitlements.size() == records[i].entitlements.size());
        for (auto a = again[i].entitlements.begin(), b = records[i].entitlements.begin();
             a != again[i].entitlements.end(); ++a, ++b)
            REQUIRE(a->first == b->first && a->second.type() == b->second.type());
    }
    return 0;
}
