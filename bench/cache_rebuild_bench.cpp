// The container cache over 10,000 data containers of one class: the cold rebuild of
// the class index against the floor (list the class directory, read every metadata
// file, and also decode it), and a warm lookup against its floor (the one existence
// check of the metadata file each lookup must make). Warm page cache throughout.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <random>

#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLContainerCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/Log.h"
#include "Platform/PropertyList.h"
#include "Platform/SandboxState.h"
#include "Platform/SystemRoot.h"
#include "fs_bench_tree.h"

using namespace vsl;

namespace {

constexpr int kContainers = 10000;
constexpr int kRounds = 5;
constexpr int kLookups = 200000;

void writeAll(const std::string& path, const std::string& bytes) {
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0 || ::write(fd, bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size())) {
        std::perror(path.c_str());
        std::exit(1);
    }
    ::close(fd);
}

std::string readAll(const std::string& path) {
    std::string bytes;
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return bytes;
    char buf[4096];
    for (ssize_t n; (n = ::read(fd, buf, sizeof buf)) > 0;) bytes.append(buf, static_cast<size_t>(n));
    ::close(fd);
    return bytes;
}

// The floor: list the class directory and read (optionally decode) every metadata file.
size_t bareScan(const std::string& classDir, bool decode) {
    size_t found = 0;
    DIR* dir = ::opendir(classDir.c_str());
    while (dirent* e = ::readdir(dir)) {
        if (e->d_name[0] == '.') continue;
        std::string bytes = readAll(classDir + "/" + e->d_name + "/" + kVSLMetadataFileName);
        if (decode ? decodePropertyList(bytes.data(), bytes.size(), nullptr).has_value() : !bytes.empty()) found++;
    }
    ::closedir(dir);
    return found;
}

}  // namespace

int main() {
    ::setenv("VESSELD_OSLOG", "off", 1);
    std::string scratch = fsbench::makeScratchDir();
    for (const char* dir : {"/etc", "/private", "/private/var", "/private/var/mobile"})
        ::mkdir((scratch + dir).c_str(), 0755);
    writeAll(scratch + "/etc/passwd",
             "root:x:0:0::/private/var/root:/bin/sh\nmobile:x:501:501::/private/var/mobile:/bin/sh\n");
    setSystemRoot(scratch);
    openLogFile({scratch + "/log", "vesseld.log", 64 << 20, 1});

    VSLUserIdentityCache::Options options;
    options.userManagement = UserManagement::createWithSource([] { return PersonaAttributesList{}; });
    options.personasSupported = false;
    auto identities = VSLUserIdentityCache::create(options);
    VSLUserIdentityRef mobile = VSLUserIdentityCache::defaultUserIdentity();
    std::string classDir = *VSLGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(mobile, 2, false);

    // Setup through the record's own dictionary, without the durable write's fsyncs.
    std::vector<std::string> identifiers;
    for (int i = 0; i < kContainers; i++) {
        identifiers.push_back("com.example.app" + std::to_string(i));
        std::string dir = classDir + "/" + Uuid::random().string();
        ::mkdir(dir.c_str(), 0755);
        uint64_t code = kVSLSuccess;
        auto identity =
            VSLConcreteContainerIdentity::containerIdentityWithUUID(Uuid::random(), mobile, identifiers.back(), 2, &code);
        auto metadata = VSLMetadata::initWithContainerIdentity(identity, std::nullopt, dir, std::nullopt);
        writeAll(dir + "/" + kVSLMetadataFileName, *encodeBinaryPropertyList(metadata->metadataDictionary(), nullptr));
    }
    std::printf("containers: %d of class 2 in %s\n", kContainers, classDir.c_str());
    bareScan(classDir, true);  // warm the page cache

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
        listRead.push_back(fsbench::millisecondsOf([&] { seen = bareScan(classDir, false); }));
        listReadDecode.push_back(fsbench::millisecondsOf([&] { bareScan(classDir, true); }));
        cold.push_back(fsbench::millisecondsOf([&] { rebuild(false); }));
        coldSandbox.push_back(fsbench::millisecondsOf([&] { rebuild(true); }));
    }
    if (seen != static_cast<size_t>(kContainers)) {
        std::fprintf(stderr, "floor saw %zu containers\n", seen);
        return 1;
    }
    double floor = fsbench::median(listRead);
    std::printf("floor list+read %.1f ms, list+read+decode %.1f ms\n", floor, fsbench::median(listReadDecode));
    fsbench::printRatio("cold-rebuild", fsbench::median(cold), floor, "list+read");
    fsbench::printRatio("cold-rebuild-with-sandbox-items-in-place", fsbench::median(coldSandbox), floor, "list+read");
    std::printf("first rebuild after boot (pushes %d sandbox items): %.1f ms\n", kContainers, firstBoot);

    // Warm lookups of random identifiers against the existence check each one makes.
    auto cache = rebuild(true);
    std::mt19937 random(42);
    std::vector<VSLContainerIdentityRef> wanted;
    std::vector<std::string> metadataPaths;
    for (int i = 0; i < kLookups; i++) {
        const std::string& id = identifiers[random() % identifiers.size()];
        wanted.push_back(identity(id));
    }
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
    double perLookup = lookups * 1e6 / kLookups, perStat = stats * 1e6 / kLookups;
    std::printf("warm lookup: %.0f ns each, lstat floor %.0f ns, ratio %.2f (%zu hits)\n", perLookup, perStat,
                perLookup / perStat, hits);
    fsbench::runShell("rm -rf '" + scratch + "'");
    return 0;
}
