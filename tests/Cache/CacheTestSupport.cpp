#include "Cache/CacheTestSupport.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <fstream>

#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/PropertyList.h"
#include "Platform/SandboxState.h"
#include "Platform/SystemRoot.h"

namespace vsl::test {

TempRoot& cacheTestRoot() {
    static TempRoot root;
    return root;
}

void resetCacheTestRoot() {
    TempRoot& root = cacheTestRoot();
    for (const char* relative : {"private/var/containers", "private/var/root", "private/var/mobile/Containers",
                                 "private/var/enterprise", "run"})
        removeTree(root.at(relative));
    VSLGlobalConfiguration::resetSharedInstanceForTesting();
    ASSERT_EQ(0, SandboxState::clearForBoot());
}

std::shared_ptr<VSLUserIdentityCache> identityCacheWithoutPersonas() {
    return identityCacheWithPersonas({});
}

std::shared_ptr<VSLUserIdentityCache> identityCacheWithPersonas(const PersonaAttributesList& personas) {
    VSLUserIdentityCache::Options options;
    options.userManagement = UserManagement::createWithSource([personas] { return personas; });
    options.personasSupported = !personas.empty();
    options.sleep = [](std::chrono::seconds) {};
    return VSLUserIdentityCache::create(options);
}

std::string classDirectory(const VSLUserIdentityRef& user, VSLContainerClass containerClass, bool transient) {
    auto dir = VSLGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(user, containerClass,
                                                                                              transient);
    EXPECT_TRUE(dir);
    return dir.value_or("");
}

VSLMetadataRef makeContainer(const VSLUserIdentityRef& user, VSLContainerClass containerClass,
                             const std::string& identifier, bool transient) {
    std::string dir = joinPath(classDirectory(user, containerClass, transient), Uuid::random().string());
    EXPECT_EQ(0, ::mkdir(dir.c_str(), 0755)) << dir;
    uint64_t code = kVSLSuccess;
    auto identity =
        VSLConcreteContainerIdentity::containerIdentityWithUUID(Uuid::random(), user, identifier, containerClass, &code);
    EXPECT_TRUE(identity) << code;
    auto metadata = VSLMetadata::initWithContainerIdentity(identity, std::nullopt, dir, std::nullopt);
    VSLErrorRef error;
    EXPECT_TRUE(metadata && metadata->writeMetadataToDiskWithError(&error)) << (error ? error->description() : "");
    return metadata;
}

std::string metadataPathOf(const std::string& containerDirectory) {
    return joinPath(containerDirectory, kVSLMetadataFileName);
}

void writeBytes(const std::string& path, const std::string& bytes) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << bytes;
    ASSERT_TRUE(out.good()) << path;
}

std::string binaryPlist(const Value& value) {
    auto bytes = encodeBinaryPropertyList(value, nullptr);
    EXPECT_TRUE(bytes);
    return bytes.value_or("");
}

}  // namespace vsl::test
