#include "Platform/NamedSemaphore.h"

#include <fcntl.h>
#include <semaphore.h>
#include <stdlib.h>

#include <cerrno>
#include <climits>

#include "Platform/Sha256.h"
#include "Platform/Value.h"

namespace vsl {

std::string semaphoreNameForSystemRoot(const std::string& base, const std::string& root) {
    char real[PATH_MAX];
    std::string path = ::realpath(root.c_str(), real) ? real : root;
    if (path == "/") return "/" + base;
    return "/" + base + "-" + hexDigits(sha256(path).data(), 8);
}

bool semaphoreExists(const std::string& name) {
    sem_t* s = ::sem_open(name.c_str(), 0);
    // One made read-only (as markers are) exists even when it cannot be opened.
    if (s == SEM_FAILED) return errno != ENOENT;
    ::sem_close(s);
    return true;
}

int createSemaphore(const std::string& name, mode_t mode, unsigned value) {
    sem_t* s = ::sem_open(name.c_str(), O_CREAT, mode, value);
    if (s == SEM_FAILED) return errno;
    ::sem_close(s);
    return 0;
}

int removeSemaphore(const std::string& name) {
    if (::sem_unlink(name.c_str()) == 0 || errno == ENOENT) return 0;
    return errno;
}

}  // namespace vsl
