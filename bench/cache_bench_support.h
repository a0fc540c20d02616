// Shared by the container-cache benchmarks: a scratch system root, containers written
// without the durable write's fsyncs (set-up, not what is measured), and the floor of
// a rebuild: list the class directory and read every metadata file.
#pragma once

#include <dirent.h>
#include <fcntl.h>
#include <malloc.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "Daemon/Core/VSLContainerIdentity.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/Log.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "fs_bench_tree.h"

namespace cachebench {

inline void writeAll(const std::string& path, const std::string& bytes) {
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0 || ::write(fd, bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size())) {
        std::perror(path.c_str());
        std::exit(1);
    }
    ::close(fd);
}

inline std::string readAll(const std::string& path) {
    std::string bytes;
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return bytes;
    char buf[4096];
    for (ssize_t n; (n = ::read(fd, buf, sizeof buf)) > 0;) bytes.append(buf, static_cast<size_t>(n));
    ::close(fd);
    return bytes;
}

// A scratch system root with a "mobile" user, made current; returns its path.
inline std::string makeSystemRoot() {
    ::setenv("VESSELD_OSLOG", "off", 1);
    std::string scratch = fsbench::makeScratchDir();
    for (const char* dir : {"/etc", "/private", "/private/var", "/private/var/mobile"})
        ::mkdir((scratch + dir).c_str(), 0755);
    writeAll(scratch + "/etc/passwd",
             "root:x:0:0::/private/var/root:/bin/sh\nmobile:x:501:501::/private/var/mobile:/bin/sh\n");
    vsl::setSystemRoot(scratch);
    vsl::openLogFile({scratch + "/log", "vesseld.log", 64 << 20, 1});
    return scratch;
}

// A new container directory in `classDir` with its metadata file.
inline void writeContainer(const std::string& classDir, const vsl::VSLUserIdentityRef& user,
                           const std::string& identifier, vsl::VSLContainerClass containerClass) {
    std::string dir = classDir + "/" + vsl::Uuid::random().string();
    ::mkdir(dir.c_str(), 0755);
    uint64_t code = vsl::kVSLSuccess;
    auto identity = vsl::VSLConcreteContainerIdentity::containerIdentityWithUUID(vsl::Uuid::random(), user, identifier,
                                                                                 containerClass, &code);
    auto metadata = vsl::VSLMetadata::initWithContainerIdentity(identity, std::nullopt, dir, std::nullopt);
    writeAll(dir + "/" + vsl::kVSLMetadataFileName,
             *vsl::encodeBinaryPropertyList(metadata->metadataDictionary(), nullptr));
}

// The floor: list the class directory and read (optionally decode) every metadata file.
inline size_t bareScan(const std::string& classDir, bool decode) {
    size_t found = 0;
    DIR* dir = ::opendir(classDir.c_str());
    if (!dir) return 0;
    while (dirent* e = ::readdir(dir)) {
        if (e->d_name[0] == '.') continue;
        std::string bytes = readAll(classDir + "/" + e->d_name + "/" + vsl::kVSLMetadataFileName);
        if (decode ? vsl::decodePropertyList(bytes.data(), bytes.size(), nullptr).has_value() : !bytes.empty())
            found++;
    }
    ::closedir(dir);
    return found;
}

// Heap bytes in use: what a structure built in between holds, without the allocator's
// retained pages.
inline size_t heapInUse() { return mallinfo2().uordblks + mallinfo2().hblkhd; }

}  // namespace cachebench
