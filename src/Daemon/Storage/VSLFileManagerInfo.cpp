// Protection classes of single items, disk usage and the diagnostic tree listing.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Daemon/Storage/VSLFileManager.h"
#include "Platform/DeviceFacts.h"
#include "Platform/ProtectionClass.h"
#include "Platform/TreeWalk.h"

namespace vsl {

namespace {

int openItem(const std::string& url, VSLErrorRef* error) {
    // O_NONBLOCK: a FIFO in a container must not hang the daemon.
    int fd = ::open(url.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0 && error) {
        int err = errno;
        *error = VSL_POSIX_ERROR(err, "Failed to open %s : %s", url, std::strerror(err));
    }
    return fd;
}

const char* const kDiskUsageStart = " path=%{private, signpost.description:attribute}@ ";
const char* const kDiskUsageEnd =
    " path=%{private, signpost.description:attribute}@  numNodes=%{public, signpost.description:attribute}llu  "
    "size=%{private, signpost.description:attribute}llu ";

struct TreeSize {
    uint64_t descendants = 0;
    uint64_t bytes = 0;
};

// The forced-walk statistics: regular-file bytes and nodes below the top. A top that
// cannot be read is a failure; unreadable parts further down are left out.
int measureTree(const std::string& url, TreeSize* size) {
    int topError = 0;
    int rc = walkTree(url, [&](FTSENT* node) {
        if (node->fts_info == FTS_DP) return true;
        if (node->fts_info == FTS_NS || node->fts_info == FTS_ERR || node->fts_info == FTS_DNR) {
            if (node->fts_level == 0) topError = node->fts_errno;
            return node->fts_level != 0;
        }
        if (node->fts_level > 0) size->descendants++;
        if (node->fts_info == FTS_F) size->bytes += static_cast<uint64_t>(node->fts_statp->st_size);
        return true;
    });
    return topError ? topError : rc;
}

}  // namespace

bool VSLFileManager::dataProtectionClassOfItemAtURL(const std::string& url, VSLDataProtectionClass* protectionClass,
                                                    VSLErrorRef* error) const {
    int fd = openItem(url, error);
    if (fd < 0) return false;
    int value = 0;
    int rc = getProtectionClass(fd, &value);
    ::close(fd);
    if (rc) {
        if (error) *error = VSL_POSIX_ERROR(rc, "Failed to getclass of file %s: %s", url, std::strerror(rc));
        return false;
    }
    if (protectionClass) *protectionClass = static_cast<VSLDataProtectionClass>(value);
    return true;
}

bool VSLFileManager::setDataProtectionClassOfItemAtURL(const std::string& url, VSLDataProtectionClass protectionClass,
                                                       const std::function<bool(VSLDataProtectionClass)>& predicate,
                                                       VSLErrorRef* error) const {
    int fd = openItem(url, error);
    if (fd < 0) return false;
    int rc = 0;
    if (predicate) {
        int current = 0;
        if ((rc = getProtectionClass(fd, &current))) {
            ::close(fd);
            if (error) *error = VSL_POSIX_ERROR(rc, "Failed to getclass of file %s: %s", url, std::strerror(rc));
            return false;
        }
        if (!predicate(static_cast<VSLDataProtectionClass>(current))) {
            ::close(fd);
            return true;
        }
    }
    rc = setProtectionClass(fd, url, static_cast<int>(protectionClass));
    ::close(fd);
    if (rc) {
        if (error)
            *error = VSL_POSIX_ERROR(rc, "Failed to setclass(%d) on file %s: %s", static_cast<int>(protectionClass), url,
                                     std::strerror(rc));
        return false;
    }
    return true;
}

uint64_t VSLFileManager::diskUsageForURL(const std::string& url) const {
    if (url.empty()) {
        osLog(LogCategory::Fs, OSLogLevel::Error, "Failed to get path to url %@", url);
        return 0;
    }
    SignpostInterval signpost(LogCategory::Fs, "CalculatingDiskUsage", kDiskUsageStart, url);
    TreeSize size;
    int rc = measureTree(url, &size);
    signpost.end(kDiskUsageEnd, url, static_cast<unsigned long long>(size.descendants),
                 static_cast<unsigned long long>(size.bytes));
    if (rc) {
        osLog(LogCategory::Fs, OSLogLevel::Error, "Failed to get dirstats on %s using fallback: (err %d) %s", url, rc,
              std::strerror(rc));
        return 0;
    }
    osLog(LogCategory::Fs, OSLogLevel::Info, "[%s]: descendants: %llu, total size: %llu, using fallback", url,
          static_cast<unsigned long long>(size.descendants), static_cast<unsigned long long>(size.bytes));
    return size.bytes;
}

uint64_t VSLFileManager::fastDiskUsageForURL(const std::string& url) const {
    if (!deviceFacts().featureEnabled("fast_container_sizing")) return diskUsageForURL(url);
    {
        SignpostInterval signpost(LogCategory::Fs, "CalculatingDiskUsage", kDiskUsageStart, url);
        // No Linux file system keeps per-directory statistics, and none can be asked to
        // start: both requests answer ENOTSUP, so this always ends in the walk.
        int rc = ENOTSUP;
        osLog(LogCategory::Fs, OSLogLevel::Error, "Failed to set maintain-dir-stats on %s: (err %d) %s", url, rc,
              std::strerror(rc));
        signpost.end(kDiskUsageEnd, url, 0ull, 0ull);
    }
    return diskUsageForURL(url);
}

void VSLFileManager::printDirectoryStructureAtURL(const std::string& url) const {
    static const char* const fn = "-[VSLFileManager printDirectoryStructureAtURL:]";
    TreeWalkFailure where;
    int rc = walkTree(
        url,
        [&](FTSENT* node) {
            switch (node->fts_info) {
                case FTS_DP:
                    return true;
                case FTS_ERR:
                case FTS_DNR:
                case FTS_NS:
                    LogWrite(kLogLevelError, fn, "FTS returned error for %s : %s", node->fts_path,
                             std::strerror(node->fts_errno));
                    return true;
                default:
                    break;
            }
            const char* kind = node->fts_info == FTS_D ? "/" : S_ISLNK(node->fts_statp->st_mode) ? "@" : "";
            LogWrite(kLogLevelNotice, fn, "%s%s%s (%llu bytes)", std::string(2 * node->fts_level, ' '),
                     node->fts_name, kind, static_cast<unsigned long long>(node->fts_statp->st_size));
            return true;
        },
        &where);
    if (rc && where == TreeWalkFailure::Open)
        LogWrite(kLogLevelError, fn, "fts_open failed for %@ : %s", url, std::strerror(rc));
}

}  // namespace vsl
