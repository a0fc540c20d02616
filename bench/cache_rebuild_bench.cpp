// The container cache over 10,000 data containers of one class: the cold rebuild of
// the class index against the floor (list the class directory and read every
// metadata file), with and without the sandbox items already in place, and a warm
// lookup against the one existence check of the metadata file each lookup makes.
// Warm page cache throughout. The 100,000-container scale is scale_bench.
#include <random>

#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "cache_bench_support.h"

using namespace vsl;

namespace {

constexpr int kContainers = 10000;
constexpr int kRounds = 5;
constexpr int kLookups = 200000;

}  // namespace

int main() {
    std::string scratch = cachebench::makeSystemRoot();
    VSLUserIdentityCache::Options options;
    options.userManagement = UserManagement::createWithSource([] { return PersonaAttributesList{}; });
    options.personasSupported = false;
    auto identities = VSLUserIdentityCache::create(options);
    VSLUserIdentityRef mobile = VSLUserIdentityCache::defaultUserIdentity();
    std::string classDir = *VSLGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(mobile, 2, false);

    std::vector<std::string> identifiers;
    for (int i = 0; i < kContainers; i++) {
        identifiers.push_back("com.example.app" + std::to_string(i));
        cachebench::writeContainer(classDir, mobile, identifiers.back(), 2);
    }
    cachebench::bareScan(classDir, true);  // warm the page cache

    auto identity = [&](const std::string& identifier) {
        uint64_t code = kVSLSuccess;
        return VSLContainerIdentity::containerIdentityWithUserIdentity(mobile, identifier, 2, &code);
    };
    auto rebuild = [&](bool updateSandbox) {
        auto cache = VSLContainerCache::initWithUserIdentityCache(identities, nullptr);
        VSLErrorRef error;
        if (!cache->containerForContainerIdentity(identity(identifiers[0]), false, updateSandbox, false, &error)) {
            std::fprintf(stderr, "lookup failed: %s\n", error ? error->description().c_str() : "?");
            std::exit(1);
        }
        return cache;
    };

    double firstBoot = fsbench::millisecondsOf([&] { rebuild(true); });
    std::vector<double> listRead, listReadDecode, cold, coldSandbox;
    size_t seen = 0;
    for (int round = 0; round < kRounds; round++) {
        listRead.push_back(fsbench::millisecondsOf([&] { seen = cachebench::bareScan(classDir, false); }));
        listReadDecode.push_back(fsbench::millisecondsOf([&] { cachebench::bareScan(classDir, true); }));
        cold.push_back(fsbench::millisecondsOf([&] { rebuild(false); }));
        coldSandbox.push_back(fsbench::millisecondsOf([&] { rebuild(true); }));
    }
    if (seen != static_cast<size_t>(kContainers))
        vslbench::floorUnavailable("cache_rebuild_bench", "the floor saw " + std::to_string(seen) + " containers");
    std::fprintf(stderr, "floor list+read+decode %.1f ms; first rebuild after boot (pushes %d sandbox items) %.1f ms\n",
                 fsbench::median(listReadDecode), kContainers, firstBoot);
    fsbench::printRatio("cold rebuild, 10k containers / list+read", cold, listRead, "<= 1.3");
    fsbench::printRatio("cold rebuild, sandbox items in place / list+read", coldSandbox, listRead, "<= 1.3");

    // Warm lookups of random identifiers against the existence check each one makes.
    auto cache = rebuild(true);
    std::mt19937 random(42);
    std::vector<VSLContainerIdentityRef> wanted;
    std::vector<std::string> metadataPaths;
    for (int i = 0; i < kLookups; i++) wanted.push_back(identity(identifiers[random() % identifiers.size()]));
    for (int i = 0; i < kContainers; i++)
        metadataPaths.push_back(cache->containerForContainerIdentity(wanted[i], false, true, nullptr)->url() + "/" +
                                kVSLMetadataFileName);
    size_t hits = 0;
    double lookups = fsbench::millisecondsOf([&] {
        for (const auto& w : wanted) hits += cache->containerForContainerIdentity(w, false, true, nullptr) != nullptr;
    });
    double stats = fsbench::millisecondsOf([&] {
        struct stat st;
        for (int i = 0; i < kLookups; i++) hits += ::lstat(metadataPaths[i % kContainers].c_str(), &st) == 0;
    });
    vslbench::printRow("warm cache lookup / lstat of its metadata", lookups * 1e6 / kLookups, stats * 1e6 / kLookups,
                       "ns", "(none)");
    fsbench::runShell("rm -rf '" + scratch + "'");
    return 0;
}
