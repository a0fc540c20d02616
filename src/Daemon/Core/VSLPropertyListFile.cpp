#include "Daemon/Core/VSLPropertyListFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <new>

#include "Platform/DurableIO.h"
#include "Platform/PropertyList.h"
#include "Platform/UniqueFd.h"

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

#ifdef VESSEL_KILLPOINTS
// Test builds: VESSELD_TEST_FAIL_READ=TEXT makes the first read of a path containing
// TEXT fail with EIO, once per process.
bool injectedReadFailure(const std::string& path) {
    static const char* const pattern = std::getenv("VESSELD_TEST_FAIL_READ");
    static std::atomic<bool> spent{false};
    if (!pattern || !*pattern || spent.load() || path.find(pattern) == std::string::npos) return false;
    return !spent.exchange(true);
}
#else
bool injectedReadFailure(const std::string&) { return false; }
#endif

}  // namespace

bool VSL_writeToURL(const Value& dictionary, const std::string& path, unsigned options, VSLErrorRef* error) {
    std::string why;
    auto bytes = encodeBinaryPropertyList(dictionary, &why);
    if (!bytes) {
        if (error) *error = generalError(__func__, __LINE__, kGeneralErrorUnreadablePropertyList, why);
        return false;
    }
    // A file the reader would refuse must never be written: it would read as damaged.
    if (bytes->size() > kVSLMaxPropertyListFileSize) {
        if (error)
            *error = VSL_POSIX_ERROR(EFBIG, "Refusing to write %@: %llu bytes exceed the read limit of %llu", path,
                                     static_cast<unsigned long long>(bytes->size()),
                                     static_cast<unsigned long long>(kVSLMaxPropertyListFileSize));
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
    const char* const function = __func__;
    auto refuse = [&](int err, const char* what) -> std::optional<Value> {
        if (error) *error = createPOSIXError(function, __LINE__, err, "%s %@: %s", what, path, std::strerror(err));
        return std::nullopt;
    };
    if (injectedReadFailure(path)) return refuse(EIO, "Failed to read");
    // Not a symlink, and never blocking on a FIFO or device someone put in its place.
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
    if (!fd) return refuse(errno, "Failed to open");
    // Read from the file itself each time (no parsed copy is kept anywhere); the page
    // cache is coherent with the file, and dropping it made class rebuilds ~6x slower.
    struct stat st;
    if (::fstat(fd.get(), &st) != 0) return refuse(errno, "Failed to stat");
    if (!S_ISREG(st.st_mode)) return refuse(EINVAL, "Refusing to read a file that is not regular:");
    if (static_cast<size_t>(st.st_size) > kVSLMaxPropertyListFileSize) return refuse(EFBIG, "Refusing to read");
    std::string bytes;
    try {
        bytes.resize(static_cast<size_t>(st.st_size));
    } catch (const std::bad_alloc&) {
        return refuse(ENOMEM, "Failed to read");
    }
    size_t got = 0;
    while (got < bytes.size()) {
        ssize_t n = ::read(fd.get(), bytes.data() + got, bytes.size() - got);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return refuse(errno, "Failed to read");
        if (n == 0) break;  // shrank meanwhile: the parser sees a torn file
        got += static_cast<size_t>(n);
    }
    fd.reset();
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

bool isReadFailure(const VSLErrorRef& error) {
    for (const VSLError* e = error.get(); e; e = e->underlyingError.get()) {
        if (e->domain != VSLPOSIXErrorDomain) continue;
        for (int err : {EIO, ENOMEM, EMFILE, ENFILE, EACCES})
            if (e->code == err) return true;
    }
    return false;
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
