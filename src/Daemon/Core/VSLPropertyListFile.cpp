#include "Daemon/Core/VSLPropertyListFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Platform/DurableIO.h"
#include "Platform/PropertyList.h"

namespace vsl {

namespace {

VSLErrorRef generalError(const char* function, int line, int64_t code, const std::string& message) {
    auto e = std::make_shared<VSLError>();
    e->domain = VSLGeneralErrorDomain;
    e->code = code;
    e->localizedDescription = message;
    e->functionName = function;
    e->sourceFileLine = line;
    return e;
}

}  // namespace

bool VSL_writeToURL(const Value& dictionary, const std::string& path, unsigned options, VSLErrorRef* error) {
    std::string why;
    auto bytes = encodeBinaryPropertyList(dictionary, &why);
    if (!bytes) {
        if (error) *error = generalError(__func__, __LINE__, kGeneralErrorUnreadablePropertyList, why);
        return false;
    }
    // No protection classes on this file: nothing to do on a system without them.
    int rc = (options & kVSLWriteAtomic) ? durable::writeFileAtomically(path, bytes->data(), bytes->size(), 0644)
                                         : durable::writeFile(path, bytes->data(), bytes->size(), 0644);
    if (rc != 0) {
        if (error) *error = VSL_POSIX_ERROR(rc, "Failed to write %@: %s", path, std::strerror(rc));
        return false;
    }
    return true;
}

std::optional<Value> VSL_dictionaryWithContentsOfURL(const std::string& path, unsigned options,
                                                     VSLErrorRef* error) {
    (void)options;
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        int err = errno;
        if (error) *error = VSL_POSIX_ERROR(err, "Failed to open %@: %s", path, std::strerror(err));
        return std::nullopt;
    }
    // Read from the file itself each time (no parsed copy is kept anywhere); the page
    // cache is coherent with the file, and dropping it made class rebuilds ~6x slower.
    struct stat st;
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode) || static_cast<size_t>(st.st_size) > kVSLMaxPropertyListFileSize) {
        int err = S_ISREG(st.st_mode) ? EFBIG : EINVAL;
        ::close(fd);
        if (error) *error = VSL_POSIX_ERROR(err, "Refusing to read %@: %s", path, std::strerror(err));
        return std::nullopt;
    }
    std::string bytes;
    bytes.resize(static_cast<size_t>(st.st_size));
    size_t got = 0;
    while (got < bytes.size()) {
        ssize_t n = ::read(fd, bytes.data() + got, bytes.size() - got);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        got += static_cast<size_t>(n);
    }
    ::close(fd);
    bytes.resize(got);
    std::string why;
    auto value = decodePropertyList(bytes.data(), bytes.size(), &why);
    if (!value) {
        if (error) *error = generalError(__func__, __LINE__, kGeneralErrorUnreadablePropertyList, why);
        return std::nullopt;
    }
    if (!value->isDictionary()) {
        if (error)
            *error = generalError(__func__, __LINE__, kGeneralErrorNotADictionary,
                                  std::string("Property list root is a ") + value->typeName());
        return std::nullopt;
    }
    return value;
}

bool containsDotDotPathComponents(const std::string& path) {
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string::npos) end = path.size();
        if (path.compare(start, end - start, "..") == 0 && end - start == 2) return true;
        start = end + 1;
    }
    return false;
}

}  // namespace vsl
