// The container cache at scale: containers spread over four personas (one personal,
// three enterprise), measured first at a tenth of the size and again at the full
// size (default 100,000): the cold rebuild of every persona's index against the
// floor (list each class directory, read every metadata file), the heap the
// rebuilt cache holds per container, the resident set after the rebuild, a warm
// lookup against the lstat of its metadata file, and how each grows over the ten
// times more containers (ratio to linear growth; at most 1 is linear or better).
// Warm page cache. The tree is made in /dev/shm when it has room (VESSEL_BENCH_ON_DISK=1
// keeps it in TMPDIR): making and removing 200,000 entries on a disk that discards
// every freed block takes minutes, and both sides are measured on the same tree.
//
//   scale_bench [containers, default 100000]
#include <sys/statvfs.h>

#include <random>

#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "cache_bench_support.h"

using namespace vsl;

namespace {

constexpr int kRounds = 3;
constexpr int kLookups = 200000;

struct Figures {
    double rebuildMs = 0, floorMs = 0, bytesPerContainer = 0, lookupNs = 0, lstatNs = 0;
    long residentKiB = 0;
};

}  // namespace

int main(int argc, char** argv) {
    const int total = argc > 1 ? std::max(40, std::atoi(argv[1])) : 100000;
    struct statvfs shm {};
    if (!std::getenv("VESSEL_BENCH_ON_DISK") && ::statvfs("/dev/shm", &shm) == 0 &&
        static_cast<double>(shm.f_bavail) * shm.f_frsize > total * 16384.0)
        ::setenv("TMPDIR", "/dev/shm", 1);
    std::string scratch = cachebench::makeSystemRoot();
    std::fprintf(stderr, "tree in %s\n", scratch.c_str());
    PersonaAttributesList personas(4);
    personas[0].isPersonal = true;
    personas[0].uniqueString = "P-1";
    personas[0].kernelPersonaID = 1000;
    for (int k = 1; k < 4; k++) {
        personas[k].isEnterprise = true;
        personas[k].uniqueString = "E-" + std::to_string(k);
        personas[k].kernelPersonaID = 1000 + k;
        personas[k].layoutPath = scratch + "/private/var/enterprise/E-" + std::to_string(k);
        fsbench::runShell("mkdir -p '" + *personas[k].layoutPath + "'");
    }
    VSLUserIdentityCache::Options options;
    options.userManagement = UserManagement::createWithSource([personas] { return personas; });
    options.personasSupported = true;
    options.sleep = [](std::chrono::seconds) {};
    auto identities = VSLUserIdentityCache::create(options);
    std::vector<VSLUserIdentityRef> users{identities->userIdentityForPersonalPersona()};
    for (int k = 1; k < 4; k++) users.push_back(identities->userIdentityForPersonaUniqueString(personas[k].uniqueString, 501, 501));
    std::vector<std::string> classDirs;
    for (const auto& user : users) {
        if (!user) vslbench::floorUnavailable("scale_bench", "a persona has no user identity");
        classDirs.push_back(*VSLGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(user, 2, false));
    }

    std::vector<std::string> identifiers;
    auto identity = [&](int i) {
        uint64_t code = kVSLSuccess;
        return VSLContainerIdentity::containerIdentityWithUserIdentity(users[i % 4], identifiers[i], 2, &code);
    };
    auto grow = [&](int count) {
        while (static_cast<int>(identifiers.size()) < count) {
            int i = static_cast<int>(identifiers.size());
            identifiers.push_back("com.example.scale.app" + std::to_string(i));
            cachebench::writeContainer(classDirs[i % 4], users[i % 4], identifiers.back(), 2);
        }
    };
    auto rebuild = [&] {
        auto cache = VSLContainerCache::initWithUserIdentityCache(identities, nullptr);
        for (int k = 0; k < 4; k++) {
            VSLErrorRef error;
            if (!cache->containerForContainerIdentity(identity(k), false, false, false, &error)) {
                std::fprintf(stderr, "lookup failed: %s\n", error ? error->description().c_str() : "?");
                std::exit(1);
            }
        }
        return cache;
    };
    auto measure = [&](int count) {
        grow(count);
        for (const auto& dir : classDirs) cachebench::bareScan(dir, false);  // warm the page cache
        rebuild();
        Figures f;
        std::vector<double> floor, cold;
        size_t seen = 0;
        for (int round = 0; round < kRounds; round++) {
            floor.push_back(fsbench::millisecondsOf([&] {
                seen = 0;
                for (const auto& dir : classDirs) seen += cachebench::bareScan(dir, false);
            }));
            cold.push_back(fsbench::millisecondsOf([&] { rebuild(); }));
        }
        if (seen != static_cast<size_t>(count))
            vslbench::floorUnavailable("scale_bench", "the floor saw " + std::to_string(seen) + " containers");
        f.floorMs = fsbench::median(floor);
        f.rebuildMs = fsbench::median(cold);
        size_t before = cachebench::heapInUse();
        auto cache = rebuild();
        f.bytesPerContainer = static_cast<double>(cachebench::heapInUse() - before) / count;
        f.residentKiB = vslbench::residentKiB();

        std::mt19937 random(42);
        std::vector<VSLContainerIdentityRef> wanted;
        std::vector<std::string> metadataPaths;
        for (int i = 0; i < kLookups; i++) wanted.push_back(identity(static_cast<int>(random() % count)));
        for (int i = 0; i < 10000; i++)
            metadataPaths.push_back(cache->containerForContainerIdentity(wanted[i], false, false, nullptr)->url() +
                                    "/" + kVSLMetadataFileName);
        size_t hits = 0;
        f.lookupNs = fsbench::millisecondsOf([&] {
            for (const auto& w : wanted) hits += cache->containerForContainerIdentity(w, false, false, nullptr) != nullptr;
        }) * 1e6 / kLookups;
        f.lstatNs = fsbench::millisecondsOf([&] {
            struct stat st;
            for (int i = 0; i < kLookups; i++) hits += ::lstat(metadataPaths[i % 10000].c_str(), &st) == 0;
        }) * 1e6 / kLookups;
        std::fprintf(stderr, "%d containers: rebuild %.1f ms (floor %.1f), %.0f heap bytes each, RSS %ld KiB, "
                     "lookup %.0f ns (lstat %.0f), %zu hits\n", count, f.rebuildMs, f.floorMs, f.bytesPerContainer,
                     f.residentKiB, f.lookupNs, f.lstatNs, hits);
        return f;
    };

    const int small = total / 10;
    Figures a = measure(small), b = measure(total);
    auto thousands = [](int v) { return v % 1000 ? std::to_string(v) : std::to_string(v / 1000) + "k"; };
    std::string n = thousands(total);
    vslbench::printRow("cold rebuild, " + n + " containers, 4 personas / list+read", b.rebuildMs, b.floorMs, "ms",
                       "<= 1.3");
    vslbench::printFigure("cache heap per container, " + n, b.bytesPerContainer / 1024, "KiB", "<= 0.5 KiB");
    vslbench::printFigure("resident set after the rebuild, " + n, b.residentKiB / 1024.0, "MiB", "(none)");
    vslbench::printRow("warm lookup, " + n + " / lstat of its metadata", b.lookupNs, b.lstatNs, "ns", "(none)");
    // Growth over ten times the containers, against linear growth (x10).
    vslbench::printRow("growth of the rebuild " + thousands(small) + "->" + n + " / linear",
                       b.rebuildMs / a.rebuildMs, 10, "x", "<= 1.0");
    vslbench::printRow("growth of the cache heap / linear", b.bytesPerContainer * total / (a.bytesPerContainer * small),
                       10, "x", "<= 1.0");
    vslbench::printRow("growth of the lookup latency / linear", b.lookupNs / a.lookupNs, 10, "x", "<= 1.0");
    fsbench::runShell("rm -rf '" + scratch + "'");
    return 0;
}
