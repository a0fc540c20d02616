// The content operations inside the daemon: what a restricted connection may wipe,
// and an asset removal whose path changes between the check and the removal (the
// file steps replaced by a double that swaps a directory for a link at that moment).
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "CodeSigning/CodeSigningTestSupport.h"
#include "Daemon/Concurrency/VSLCommandQueue.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLContentFileOperations.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Platform/SystemRoot.h"

using namespace vsl;
using namespace vsl::test;
namespace fs = std::filesystem;

namespace {

class ContentOperation : public CodeSigningTest {
protected:
    void SetUp() override {
        CodeSigningTest::SetUp();
        // Only now: the user's home comes from the test's own system root.
        user = VSLUserIdentityCache::userIdentityForLegacyMobileUser();
        privileged = VSLClientConnection::createPrivileged();
        VSLContainerCache::sharedInstance()->invalidateUserIdentity(user);
        // Built now, from empty class directories: later adds go into these indexes.
        VSLErrorRef error;
        for (VSLContainerClass c : {kVSLClassApplicationData, kVSLClassPluginData})
            VSLContainerCache::sharedInstance()->containerForContainerIdentity(identity("com.example.none", c), false,
                                                                               false, &error);
    }
    void TearDown() override {
        setContentFileOperationsForTesting(std::nullopt);
        CodeSigningTest::TearDown();
    }
    VSLContainerIdentityRef identity(const std::string& identifier, VSLContainerClass containerClass) {
        uint64_t code = kVSLSuccess;
        auto id = VSLContainerIdentity::containerIdentityWithUserIdentity(user, identifier, containerClass, &code);
        EXPECT_TRUE(id) << code;
        return id;
    }
    VSLMetadataRef create(const std::string& identifier, VSLContainerClass containerClass) {
        uint64_t code = kVSLSuccess;
        auto made = privileged->createOrLookupContainerWithContainerIdentity(identity(identifier, containerClass), true,
                                                                            false, true, &code);
        EXPECT_TRUE(made) << code;
        return made;
    }
    // Every path below `directory`, with file contents.
    static std::map<std::string, std::string> contents(const std::string& directory) {
        std::map<std::string, std::string> out;
        for (const auto& e : fs::recursive_directory_iterator(directory))
            out[e.path().string()] = e.is_regular_file() && !e.is_symlink() ? readFile(e.path().string()) : "";
        return out;
    }

    VSLUserIdentityRef user;
    VSLClientConnectionRef privileged;
};

}  // namespace

TEST_F(ContentOperation, ARestrictedConnectionWipesOnlyPlugInContainersOfItsList) {
    auto app = create("com.example.app", kVSLClassApplicationData);
    auto widget = create("com.example.app.widget", kVSLClassPluginData);
    ASSERT_TRUE(app && widget);
    std::ofstream(app->url() + "/Documents/kept") << "x";
    std::ofstream(widget->url() + "/Documents/kept") << "x";
    const auto appBefore = contents(app->url());
    const auto widgetBefore = contents(widget->url());

    // A wipe list naming both: only the class-4 container could be wiped.
    auto restricted = VSLClientConnection::create(
        nullptr, true, false, false, std::nullopt,
        std::vector<std::string>{"com.example.app", "com.example.other.widget"}, VSLCommandQueue::create());
    uint64_t code = kVSLSuccess;
    EXPECT_FALSE(restricted->deleteDataContainerContentWithContainerIdentity(
        identity("com.example.app", kVSLClassApplicationData), &code));
    EXPECT_EQ(11u, code);
    code = kVSLSuccess;
    EXPECT_FALSE(restricted->deleteDataContainerContentWithContainerIdentity(
        identity("com.example.app.widget", kVSLClassPluginData), &code));
    EXPECT_EQ(55u, code) << "not in the list";
    EXPECT_FALSE(restricted->allowOtherIdLookup()) << "a refused wipe gains no lookup right";
    // Not even an unrestricted connection wipes a class without user data; no identity: 18.
    code = kVSLSuccess;
    EXPECT_FALSE(privileged->deleteDataContainerContentWithContainerIdentity(
        identity("com.example.daemon", kVSLClassSystemData), &code));
    EXPECT_EQ(11u, code);
    code = kVSLSuccess;
    EXPECT_FALSE(privileged->deleteDataContainerContentWithContainerIdentity(nullptr, &code));
    EXPECT_EQ(18u, code);
    EXPECT_EQ(appBefore, contents(app->url()));
    EXPECT_EQ(widgetBefore, contents(widget->url()));
}

TEST_F(ContentOperation, ADirectorySwappedForALinkAfterTheCheckRemovesNothingOutside) {
    auto app = create("com.example.app", kVSLClassApplicationData);
    ASSERT_TRUE(app);
    bool existed = true;
    uint64_t code = kVSLSuccess;
    auto assets = privileged->userManagedAssetsPathWithContainerIdentity(app->containerIdentity(), false, true,
                                                                         &existed, &code);
    ASSERT_TRUE(assets) << code;
    const std::string outside = freshDirectory("outside");
    fs::create_directories(outside + "/sub");
    std::ofstream(outside + "/sub/precious") << "keep me";
    std::ofstream(outside + "/precious") << "keep me";
    const auto outsideBefore = contents(outside);

    // Between the check and the removal, `swap` (below the container) becomes a link
    // to the outside directory.
    std::string swap;
    auto ops = defaultContentFileOperations();
    auto real = ops.removeItemBelowDirectory;
    ops.removeItemBelowDirectory = [&](const std::string& directory, const std::string& relative, VSLErrorRef* error) {
        fs::rename(swap, swap + ".checked");
        fs::create_directory_symlink(outside, swap);
        return real(directory, relative, error);
    };
    setContentFileOperationsForTesting(ops);
    auto reset = [&](const std::string& directory) {
        fs::remove_all(directory);  // a link itself, not what it points to
        fs::remove_all(directory + ".checked");
        fs::create_directories(directory + "/sub");
        std::ofstream(directory + "/sub/precious") << "asset";
        std::ofstream(directory + "/precious") << "asset";
    };

    // A directory on the way to the target: the removal stops there (41).
    reset(*assets + "/dir");
    swap = *assets + "/dir";
    code = kVSLSuccess;
    EXPECT_FALSE(privileged->deleteUserManagedAssetWithContainerIdentity(app->containerIdentity(), "dir/precious", &code));
    EXPECT_EQ(41u, code);
    EXPECT_EQ(outsideBefore, contents(outside));

    // The target itself: the link goes, never what it points to.
    reset(*assets + "/dir");
    code = kVSLSuccess;
    privileged->deleteUserManagedAssetWithContainerIdentity(app->containerIdentity(), "dir", &code);
    EXPECT_FALSE(fs::exists(fs::symlink_status(*assets + "/dir")));
    EXPECT_EQ(outsideBefore, contents(outside));

    // The assets directory itself, and the Library above it.
    for (const std::string& swapped : {*assets, app->url() + "/Library"}) {
        reset(*assets + "/dir");
        swap = swapped;
        code = kVSLSuccess;
        EXPECT_FALSE(privileged->deleteUserManagedAssetWithContainerIdentity(app->containerIdentity(), "dir/sub", &code))
            << swapped;
        EXPECT_EQ(41u, code) << swapped;
        EXPECT_EQ(outsideBefore, contents(outside)) << swapped;
        fs::remove(swapped);
        fs::rename(swapped + ".checked", swapped);
    }
}
