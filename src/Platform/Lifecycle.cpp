#include "Platform/Lifecycle.h"

#include <dirent.h>
#include <poll.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <mutex>
#include <set>

#include "Platform/CodeSigningPolicy.h"
#include "Platform/DurableIO.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

std::mutex gSharedMutex;
std::shared_ptr<LifecycleService> gShared;

std::optional<std::string> executableOf(pid_t pid) {
    char buf[4096];
    std::string link = "/proc/" + std::to_string(pid) + "/exe";
    ssize_t n = ::readlink(link.c_str(), buf, sizeof buf - 1);
    if (n <= 0) return std::nullopt;  // gone, a zombie or a kernel thread
    return std::string(buf, static_cast<size_t>(n));
}

// Kills what runs one of `executables` now; true when something was found. A pidfd
// pins the process between the check of its executable and the signal, so a
// recycled pid is never hit.
bool killMatching(const std::set<std::string>& executables, std::string* error) {
    bool found = false;
    DIR* proc = ::opendir("/proc");
    if (!proc) {
        *error = std::string("Cannot list processes: ") + std::strerror(errno);
        return false;
    }
    while (struct dirent* e = ::readdir(proc)) {
        char* end = nullptr;
        long pid = std::strtol(e->d_name, &end, 10);
        if (pid <= 0 || *end || pid == ::getpid()) continue;
        auto exe = executableOf(static_cast<pid_t>(pid));
        if (!exe || !executables.count(*exe)) continue;
        UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, static_cast<pid_t>(pid), 0)));
        if (pidfd.get() < 0) continue;  // already gone
        exe = executableOf(static_cast<pid_t>(pid));
        if (!exe || !executables.count(*exe)) continue;
        if (::syscall(SYS_pidfd_send_signal, pidfd.get(), SIGKILL, nullptr, 0) != 0) {
            if (errno == ESRCH) continue;
            *error = "Cannot terminate process " + std::to_string(pid) + ": " + std::strerror(errno);
            break;
        }
        found = true;
        struct pollfd p = {pidfd.get(), POLLIN, 0};
        while (::poll(&p, 1, -1) < 0 && errno == EINTR) {
        }
    }
    ::closedir(proc);
    return found;
}

class ProcessAssertion : public LifecycleService::Assertion {
public:
    explicit ProcessAssertion(std::string marker) : marker_(std::move(marker)) {}
    void invalidate() {
        std::lock_guard<std::mutex> guard(mutex_);
        if (invalidated_) return;
        invalidated_ = true;
        durable::removeFile(marker_);  // a marker never written is no failure
    }

private:
    const std::string marker_;
    std::mutex mutex_;
    bool invalidated_ = false;
};

class ProcessLifecycleService : public LifecycleService {
public:
    bool terminationAssertionsAvailable() override { return true; }

    std::shared_ptr<Assertion> acquireTerminationAssertion(const std::string& bundleIdentifier,
                                                           const std::string& reason,
                                                           AcquisitionHandler handler) override {
        auto name = launchBlockMarkerName(bundleIdentifier);
        if (!name) return nullptr;
        auto assertion = std::make_shared<ProcessAssertion>(joinPath(launchBlockDirectory(), *name));
        std::string error;
        UniqueFd dir;
        int rc = durable::makeDirectoryNoFollow(launchBlockDirectory(), 0755, true, dir.out());
        if (!rc) {
            std::string text = reason + "\n";
            rc = durable::writeFileAtomically(joinPath(launchBlockDirectory(), *name), text.data(), text.size(),
                                              0644);
        }
        if (rc) {
            error = "Cannot write the launch-block marker: " + std::string(std::strerror(rc));
        } else {
            // The marker is in place first, so a launcher cannot start what is killed.
            std::set<std::string> executables;
            for (const auto& record : CodeSigningPolicy::shared().recordsWithSigningIdentifier(bundleIdentifier))
                executables.insert(record.executable);
            while (!executables.empty() && killMatching(executables, &error) && error.empty()) {
            }
        }
        if (handler) handler(error.empty() ? std::nullopt : std::optional<std::string>(error));
        return assertion;
    }

    void invalidate(const std::shared_ptr<Assertion>& assertion) override {
        if (auto a = std::dynamic_pointer_cast<ProcessAssertion>(assertion)) a->invalidate();
    }
};

}  // namespace

std::shared_ptr<LifecycleService> makeProcessLifecycleService() {
    return std::make_shared<ProcessLifecycleService>();
}

std::shared_ptr<LifecycleService> LifecycleService::shared() {
    std::lock_guard<std::mutex> guard(gSharedMutex);
    if (!gShared) gShared = makeProcessLifecycleService();
    return gShared;
}

void LifecycleService::setShared(std::shared_ptr<LifecycleService> service) {
    std::lock_guard<std::mutex> guard(gSharedMutex);
    gShared = std::move(service);
}

std::string launchBlockDirectory() { return rootedPath("/run/vesseld/launch-block"); }

std::optional<std::string> launchBlockMarkerName(const std::string& bundleIdentifier) {
    if (bundleIdentifier.empty()) return std::nullopt;
    static const char hex[] = "0123456789ABCDEF";
    std::string name;
    for (size_t i = 0; i < bundleIdentifier.size(); i++) {
        unsigned char c = static_cast<unsigned char>(bundleIdentifier[i]);
        if (c == '%' || c == '/' || c == '\0' || (i == 0 && c == '.')) {
            name += '%';
            name += hex[c >> 4];
            name += hex[c & 15];
        } else {
            name += static_cast<char>(c);
        }
    }
    return name;
}

}  // namespace vsl
