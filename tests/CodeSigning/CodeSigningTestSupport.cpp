#include "CodeSigning/CodeSigningTestSupport.h"

#include <sys/stat.h>

#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/SystemRoot.h"

namespace vsl::test {

TempRoot& codeSigningTestRoot() {
    static TempRoot root;
    return root;
}

std::string freshDirectory(const std::string& name) {
    std::string dir = codeSigningTestRoot().at("scratch/" + name);
    removeTree(dir);
    codeSigningTestRoot().writeFile("scratch/" + name + "/.keep", "");
    return dir;
}

OSLogCapture::OSLogCapture() : lines_(std::make_shared<std::pair<std::mutex, std::vector<std::string>>>()) {
    auto lines = lines_;
    setOSLogSink([lines](const OSLogRecord& record) {
        if (record.signpostEvent) return;
        std::lock_guard g(lines->first);
        lines->second.push_back(record.message);
    });
}

OSLogCapture::~OSLogCapture() {
    setOSLogSink({});
}

std::vector<std::string> OSLogCapture::messages() const {
    std::lock_guard g(lines_->first);
    return lines_->second;
}

size_t OSLogCapture::count(const std::string& fragment) const {
    size_t n = 0;
    for (const auto& m : messages())
        if (m.find(fragment) != std::string::npos) n++;
    return n;
}

std::shared_ptr<VSLUserIdentityCache> identityCacheWithPersonas(const PersonaAttributesList& personas) {
    VSLUserIdentityCache::Options options;
    options.userManagement = UserManagement::createWithSource([personas] { return personas; });
    options.personasSupported = !personas.empty();
    options.sleep = [](std::chrono::seconds) {};
    return VSLUserIdentityCache::create(options);
}

void CodeSigningTest::SetUp() {
    TempRoot& root = codeSigningTestRoot();
    for (const char* relative : {"private/var/containers", "private/var/root", "private/var/mobile/Containers", "run"})
        removeTree(root.at(relative));
    VSLGlobalConfiguration::resetSharedInstanceForTesting();
    // Made first, so that the mapping it keeps for itself is never one a test reopens.
    const auto& cache = VSLContainerCache::sharedInstance();
    const auto* info = ::testing::UnitTest::GetInstance()->current_test_info();
    databaseDirectory_ = freshDirectory(std::string(info->test_suite_name()) + "." + info->name());
    makeMapping(identityCacheWithPersonas({}));
    // The directories went away under the cache's indexes: make it read them afresh.
    cache->invalidateUserIdentity(VSLUserIdentityCache::defaultUserIdentity());
}

void CodeSigningTest::TearDown() {
    VSLCodeSigningMapping::setSharedInstanceForTesting(nullptr);
    mapping_.reset();
}

void CodeSigningTest::makeMapping(std::shared_ptr<VSLUserIdentityCache> userIdentityCache) {
    VSLCodeSigningMapping::setSharedInstanceForTesting(nullptr);
    mapping_.reset();  // closes the database before it is opened again
    mapping_ = VSLCodeSigningMapping::create(VSLSQLiteDB::initWithParentDirectoryURL(databaseDirectory_),
                                             std::move(userIdentityCache));
    VSLCodeSigningMapping::setSharedInstanceForTesting(mapping_);
}

Value infoWithEntitlements(const Value& entitlements, Dictionary extra) {
    extra[kVSLEntitlementsKey] = entitlements;
    return Value::dictionary(std::move(extra));
}

Value strings(std::initializer_list<const char*> items) {
    Array a;
    for (const char* s : items) a.push_back(Value::string(s));
    return Value::array(std::move(a));
}

Value appGroups(Value groups) { return infoWithEntitlements(dict({{kVSLApplicationGroupsEntitlement, groups}})); }

VSLMetadataRef makeContainer(const VSLUserIdentityRef& user, VSLContainerClass containerClass,
                             const std::string& identifier, bool transient, std::optional<Value> info) {
    auto classDirectory =
        VSLGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(user, containerClass, transient);
    EXPECT_TRUE(classDirectory);
    std::string dir = joinPath(classDirectory.value_or(""), Uuid::random().string());
    EXPECT_EQ(0, ::mkdir(dir.c_str(), 0755)) << dir;
    uint64_t code = kVSLSuccess;
    auto identity = VSLConcreteContainerIdentity::containerIdentityWithUUID(Uuid::random(), user, identifier,
                                                                            containerClass, &code);
    EXPECT_TRUE(identity) << code;
    auto metadata = VSLMetadata::initWithContainerIdentity(identity, std::move(info), dir, std::nullopt);
    VSLErrorRef error;
    EXPECT_TRUE(metadata && metadata->writeMetadataToDiskWithError(&error)) << (error ? error->description() : "");
    metadata->setTransient(transient);
    EXPECT_TRUE(VSLContainerCache::sharedInstance()->addContainerMetadata(metadata, dir, transient, false, &error))
        << (error ? error->description() : "");
    return metadata;
}

bool cacheHasContainer(const VSLUserIdentityRef& user, VSLContainerClass containerClass, const std::string& identifier,
                       bool transient) {
    uint64_t code = kVSLSuccess;
    auto identity = VSLContainerIdentity::containerIdentityWithUserIdentity(user, identifier, containerClass, &code);
    VSLErrorRef error;
    return identity && VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity, transient, false,
                                                                                          &error) != nullptr;
}

std::string deathRowPathOf(const VSLMetadata& container) {
    std::string url = container.url();
    return joinPath(VSLGlobalConfiguration::sharedInstance()->deathrowDirectory(), url.substr(url.rfind('/') + 1));
}

bool exists(const std::string& path) {
    struct stat st {};
    return ::lstat(path.c_str(), &st) == 0;
}

}  // namespace vsl::test
