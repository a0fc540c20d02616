#include "Platform/DurableIO.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <mutex>

#include "Platform/SystemRoot.h"
#include "Platform/Value.h"

namespace vsl::durable {

namespace {
std::atomic<uint64_t> gSteps{0};

#ifdef VESSEL_KILLPOINTS
struct KillConfig {
    uint64_t killAt = 0;
    std::string traceFile;
};
const KillConfig& killConfig() {
    static const KillConfig c = [] {
        KillConfig k;
        if (const char* s = std::getenv("VESSELD_KILL_AT")) k.killAt = std::strtoull(s, nullptr, 10);
        if (const char* s = std::getenv("VESSELD_DURABLE_TRACE")) k.traceFile = s;
        return k;
    }();
    return c;
}
#endif

int writeAllAndSync(int fd, const void* data, size_t length) {
    const char* p = static_cast<const char*>(data);
    while (length > 0) {
        ssize_t n = ::write(fd, p, length);
        if (n < 0) {
            if (errno == EINTR) continue;
            return errno;
        }
        p += n;
        length -= static_cast<size_t>(n);
    }
    return ::fsync(fd) == 0 ? 0 : errno;
}

int result(int rc) { return rc == 0 ? 0 : errno; }
}  // namespace

void step(const char* kind, const std::string& path) {
    uint64_t n = ++gSteps;
#ifdef VESSEL_KILLPOINTS
    const KillConfig& k = killConfig();
    if (!k.traceFile.empty()) {
        static std::mutex traceMutex;
        std::lock_guard<std::mutex> g(traceMutex);
        if (FILE* f = std::fopen(k.traceFile.c_str(), "ae")) {
            std::fprintf(f, "%llu %s %s\n", static_cast<unsigned long long>(n), kind, path.c_str());
            std::fclose(f);
        }
    }
    if (k.killAt != 0 && n == k.killAt) ::_exit(86);
#else
    (void)kind;
    (void)path;
#endif
}

uint64_t stepCount() { return gSteps.load(); }

int makeDirectory(const std::string& path, mode_t mode) {
    step("mkdir", path);
    return result(::mkdir(path.c_str(), mode));
}

int renamePath(const std::string& from, const std::string& to) {
    step("rename", to);
    return result(::rename(from.c_str(), to.c_str()));
}

int renameNoReplace(const std::string& from, const std::string& to) {
    step("rename", to);
    return result(::renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE));
}

int removeFile(const std::string& path) {
    step("unlink", path);
    return result(::unlink(path.c_str()));
}

int removeDirectory(const std::string& path) {
    step("rmdir", path);
    return result(::rmdir(path.c_str()));
}

int fsyncPath(const std::string& path) {
    step("fsync", path);
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return errno;
    int rc = ::fsync(fd) == 0 ? 0 : errno;
    ::close(fd);
    return rc;
}

int fsyncParent(const std::string& path) { return fsyncPath(parentPath(path)); }

int writeFile(const std::string& path, const void* data, size_t length, mode_t mode) {
    step("write", path);
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, mode);
    if (fd < 0) return errno;
    int rc = writeAllAndSync(fd, data, length);
    ::close(fd);
    return rc;
}

int writeFileAtomically(const std::string& path, const void* data, size_t length, mode_t mode) {
    std::string temp = joinPath(parentPath(path), "." + lastPathComponent(path) + ".tmp-" + Uuid::random().string());
    if (int rc = writeFile(temp, data, length, mode)) return rc;
    if (int rc = renamePath(temp, path)) {
        ::unlink(temp.c_str());
        return rc;
    }
    return fsyncParent(path);
}

}  // namespace vsl::durable
