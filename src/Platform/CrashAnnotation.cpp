#include "Platform/CrashAnnotation.h"

#include <execinfo.h>
#include <fcntl.h>
#include <pthread.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <mutex>

namespace vsl {

namespace {
std::mutex gMutex;
std::string gFile;
char* gMessage = nullptr;  // leaked on purpose: it must outlive everything

void writeAll(int fd, const std::string& s) {
    const char* p = s.data();
    size_t left = s.size();
    while (left > 0) {
        ssize_t n = ::write(fd, p, left);
        if (n <= 0) return;
        p += n;
        left -= static_cast<size_t>(n);
    }
}
}  // namespace

void setCrashAnnotationFile(const std::string& path) {
    std::lock_guard<std::mutex> g(gMutex);
    gFile = path;
}

void setCrashReportMessage(const std::string& text) {
    std::lock_guard<std::mutex> g(gMutex);
    char* copy = strdup(text.c_str());
    gMessage = copy;
    writeAll(STDERR_FILENO, text + "\n");
    if (!gFile.empty()) {
        int fd = ::open(gFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        if (fd >= 0) {
            writeAll(fd, text + "\n");
            ::fsync(fd);
            ::close(fd);
        }
    }
}

const char* crashReportMessage() {
    std::lock_guard<std::mutex> g(gMutex);
    return gMessage;
}

std::vector<std::string> currentCallStackSymbols(int skip) {
    void* frames[64];
    int n = backtrace(frames, 64);
    std::vector<std::string> out;
    char** symbols = backtrace_symbols(frames, n);
    for (int i = skip + 1; i < n; i++) out.emplace_back(symbols ? symbols[i] : "?");
    std::free(symbols);
    return out;
}

std::string currentThreadName() {
    char name[64] = {0};
    if (pthread_getname_np(pthread_self(), name, sizeof name) != 0) return {};
    // An unnamed thread reports the program name; only names we set count.
    static const std::string program = [] {
        char buf[64] = {0};
        int fd = ::open("/proc/self/comm", O_RDONLY | O_CLOEXEC);
        if (fd >= 0) {
            ssize_t n = ::read(fd, buf, sizeof buf - 1);
            ::close(fd);
            if (n > 0 && buf[n - 1] == '\n') buf[n - 1] = 0;
        }
        return std::string(buf);
    }();
    return program == name ? std::string() : std::string(name);
}

}  // namespace vsl
