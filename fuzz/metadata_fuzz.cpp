// Feeds arbitrary bytes to the metadata reader as a container's metadata file, the
// way a rebuild meets whatever is on disk. Checks: a refusal carries code 12 or 29;
// an accepted record is well formed, and what it writes back reads back the same.
#include <sys/stat.h>
#include <unistd.h>

#include <bit>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/Log.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"

using namespace vsl;

namespace {

#define REQUIRE(cond) ((cond) ? (void)0 : __builtin_trap())

struct World {
    std::shared_ptr<VSLUserIdentityCache> identities;
    VSLUserIdentityRef mobile;
    std::string container;  // a class 2 container directory of the mobile user
};

void writeAll(const std::string& path, const void* data, size_t size) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(static_cast<const char*>(data), static_cast<std::streamsize>(size));
}

World& world() {
    static World w = [] {
        const char* tmp = std::getenv("TMPDIR");
        std::string templ = std::string(tmp && *tmp ? tmp : "/tmp") + "/vessel-metadata-fuzz-XXXXXX";
        if (!::mkdtemp(templ.data())) std::abort();
        std::string root = templ;
        static const std::string removeAtExit = root;
        std::atexit([] {
            std::error_code ignored;
            std::filesystem::remove_all(removeAtExit, ignored);
        });
        for (const char* dir : {"/etc", "/private", "/private/var", "/private/var/mobile"})
            ::mkdir((root + dir).c_str(), 0755);
        std::string passwd = "root:x:0:0::/private/var/root:/bin/sh\nmobile:x:501:501::/private/var/mobile:/bin/sh\n";
        writeAll(root + "/etc/passwd", passwd.data(), passwd.size());
        setSystemRoot(root);
        openLogFile({root + "/log", "vesseld.log", 1 << 20, 1});

        World made;
        VSLUserIdentityCache::Options options;
        options.userManagement = UserManagement::createWithSource([] { return PersonaAttributesList{}; });
        options.personasSupported = false;
        made.identities = VSLUserIdentityCache::create(options);
        made.mobile = VSLUserIdentityCache::defaultUserIdentity();
        auto classDir = VSLGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(made.mobile, 2,
                                                                                                       false);
        if (!made.mobile || !classDir) std::abort();
        made.container = joinPath(*classDir, Uuid::random().string());
        ::mkdir(made.container.c_str(), 0755);
        return made;
    }();
    return w;
}

// Value equality, except that a NaN equals a NaN of the same bits.
bool sameValue(const Value& a, const Value& b) {
    if (a.type() != b.type()) return false;
    if (auto x = a.doubleValue()) return std::bit_cast<uint64_t>(*x) == std::bit_cast<uint64_t>(*b.doubleValue());
    if (const Array* x = a.arrayValue()) {
        const Array& y = *b.arrayValue();
        if (x->size() != y.size()) return false;
        for (size_t i = 0; i < x->size(); i++)
            if (!sameValue((*x)[i], y[i])) return false;
        return true;
    }
    if (const Dictionary* x = a.dictionaryValue()) {
        const Dictionary& y = *b.dictionaryValue();
        if (x->size() != y.size()) return false;
        for (auto i = x->begin(), j = y.begin(); i != x->end(); ++i, ++j)
            if (i->first != j->first || !sameValue(i->second, j->second)) return false;
        return true;
    }
    return a == b;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    ::setenv("VESSELD_OSLOG", "off", 1);
    world();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    World& w = world();
    std::string file = joinPath(w.container, kVSLMetadataFileName);
    writeAll(file, data, size);

    VSLErrorRef error;
    auto metadata = VSLMetadata::readAndValidateMetadataAtUrl(w.container, w.mobile, true, &error, w.identities.get());
    if (!metadata) {
        REQUIRE(error && error->isVSLDomain());
        REQUIRE(error->code == 12 || error->code == 29);
        return 0;
    }
    REQUIRE(isValidContainerClass(metadata->containerClass()));
    REQUIRE(metadata->url() == w.container);
    REQUIRE(metadata->userIdentity());
    REQUIRE(!metadata->info() || metadata->info()->isDictionary());

    // The record's own dictionary is a valid file that reads back as the same record.
    auto bytes = encodeBinaryPropertyList(metadata->metadataDictionary(), nullptr);
    REQUIRE(bytes);
    writeAll(file, bytes->data(), bytes->size());
    auto again = VSLMetadata::readAndValidateMetadataAtUrl(w.container, w.mobile, true, &error, w.identities.get());
    REQUIRE(again);
    REQUIRE(again->identifier() == metadata->identifier());
    REQUIRE(again->uuid() == metadata->uuid());
    REQUIRE(again->containerClass() == metadata->containerClass());
    REQUIRE(sameUserIdentity(again->userIdentity(), metadata->userIdentity()));
    REQUIRE(again->userManagedAssetsDirName() == metadata->userManagedAssetsDirName());
    // Not compared as bytes: the writer shares equal objects only some of the time.
    REQUIRE(sameValue(again->metadataDictionary(), metadata->metadataDictionary()));
    return 0;
}
