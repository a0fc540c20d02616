// Shared by the code-signing tests: one system root for the whole binary (the
// default user identity is made once per process and keeps pointing into it), a
// fresh database per test, a mapping installed as the process's instance, the
// structured log captured, and containers made on disk and known to the cache.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Support/TempRoot.h"

namespace vsl::test {

TempRoot& codeSigningTestRoot();

// A directory of its own below the shared root, made empty.
std::string freshDirectory(const std::string& name);

// Structured-log messages while it lives.
class OSLogCapture {
public:
    OSLogCapture();
    ~OSLogCapture();
    std::vector<std::string> messages() const;
    size_t count(const std::string& fragment) const;

private:
    std::shared_ptr<std::pair<std::mutex, std::vector<std::string>>> lines_;
};

std::shared_ptr<VSLUserIdentityCache> identityCacheWithPersonas(const PersonaAttributesList& personas);

// A mapping over a new database, installed as the shared instance, on an emptied
// root with a cache that forgot every index.
class CodeSigningTest : public ::testing::Test {
protected:
    void SetUp() override;
    void TearDown() override;
    // Replaces the mapping (same database directory unless told otherwise).
    void makeMapping(std::shared_ptr<VSLUserIdentityCache> userIdentityCache);

    std::string databaseDirectory_;
    std::shared_ptr<VSLCodeSigningMapping> mapping_;
    OSLogCapture log_;
};

// { "com.tarrow.Vesselry.Entitlements": entitlements } plus `extra` keys.
Value infoWithEntitlements(const Value& entitlements, Dictionary extra = {});
// An array of strings; info whose entitlements name these application groups.
Value strings(std::initializer_list<const char*> items);
Value appGroups(Value groups);

// A container directory named by a fresh UUID in its class directory, with its
// metadata written and the record added to the shared container cache.
VSLMetadataRef makeContainer(const VSLUserIdentityRef& user, VSLContainerClass containerClass,
                             const std::string& identifier, bool transient = false,
                             std::optional<Value> info = std::nullopt);
bool cacheHasContainer(const VSLUserIdentityRef& user, VSLContainerClass containerClass, const std::string& identifier,
                       bool transient = false);
// Where staging puts a container directory.
std::string deathRowPathOf(const VSLMetadata& container);
bool exists(const std::string& path);

}  // namespace vsl::test
