#include "Ipc/OtherUser.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <ctime>

namespace vsl::test {

namespace {

constexpr size_t kMaxHeld = 2048;
constexpr size_t kFrameRoom = 4096;
// All the replies together; only a broken server makes the child wait this long.
constexpr long kReplyWaitMs = 30000;

long nowMs() {
    timespec t{};
    ::clock_gettime(CLOCK_MONOTONIC, &t);
    return t.tv_sec * 1000 + t.tv_nsec / 1000000;
}

// Moves exactly size bytes through a pipe, either way.
bool transferAll(int fd, void* data, size_t size, bool writing) {
    char* p = static_cast<char*>(data);
    while (size > 0) {
        const ssize_t n = writing ? ::write(fd, p, size) : ::read(fd, p, size);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        p += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

void becomeUser(uid_t uid) {
    if (::getuid() == uid) return;
    if (::setgid(uid) != 0 || ::setuid(uid) != 0) ::_exit(120);
}

// The first whole frame on fd, into buffer; its size, or 0 when none came in time.
size_t readOneFrame(int fd, char* buffer, long deadline) {
    size_t have = 0;
    for (;;) {
        if (have >= kIpcLengthPrefix) {
            uint32_t length;
            std::memcpy(&length, buffer, sizeof length);  // little-endian hosts only
            if (length > kFrameRoom - kIpcLengthPrefix) return 0;
            if (have >= kIpcLengthPrefix + length) return kIpcLengthPrefix + length;
        }
        pollfd p{fd, POLLIN, 0};
        const long left = deadline - nowMs();
        if (left <= 0 || ::poll(&p, 1, static_cast<int>(left)) <= 0) return 0;
        const ssize_t n = ::recv(fd, buffer + have, kFrameRoom - have, 0);
        if (n <= 0) return 0;
        have += static_cast<size_t>(n);
    }
}

// Runs in the forked child: system calls and stack memory only, as after a fork
// of a threaded process.
[[noreturn]] void holdInChild(const char* path, uid_t uid, size_t count, const std::string& request, int report,
                              int release) {
    becomeUser(uid);
    static int fds[kMaxHeld];
    for (size_t i = 0; i < count; ++i) {
        fds[i] = ::socket(AF_UNIX, SOCK_STREAM, 0);
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        std::strncpy(addr.sun_path, path, sizeof addr.sun_path - 1);
        if (::connect(fds[i], reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0) {
            ::send(fds[i], request.data(), request.size(), MSG_NOSIGNAL);
        }
    }
    static char buffer[kFrameRoom];
    const long deadline = nowMs() + kReplyWaitMs;
    for (size_t i = 0; i < count; ++i) {
        const uint32_t size = static_cast<uint32_t>(readOneFrame(fds[i], buffer, deadline));
        uint32_t sizeCopy = size;
        if (!transferAll(report, &sizeCopy, sizeof sizeCopy, true) || !transferAll(report, buffer, size, true)) {
            ::_exit(121);
        }
    }
    char byte;
    [[maybe_unused]] ssize_t n = ::read(release, &byte, 1);
    ::_exit(0);
}

}  // namespace

bool canSwitchUser() { return ::geteuid() == 0; }

HeldConnections::HeldConnections(const std::string& path, uid_t uid, size_t count, const std::string& request) {
    if (count > kMaxHeld) count = kMaxHeld;
    int report[2], release[2];
    if (::pipe2(report, O_CLOEXEC) != 0 || ::pipe2(release, O_CLOEXEC) != 0) return;
    pid_ = ::fork();
    if (pid_ == 0) {
        ::close(report[0]);
        ::close(release[1]);
        holdInChild(path.c_str(), uid, count, request, report[1], release[0]);
    }
    ::close(report[1]);
    ::close(release[0]);
    release_ = release[1];
    std::string bytes;
    for (size_t i = 0; i < count; ++i) {
        uint32_t size = 0;
        if (!transferAll(report[0], &size, sizeof size, false)) break;
        bytes.assign(size, '\0');
        if (size > 0 && !transferAll(report[0], bytes.data(), size, false)) break;
        std::optional<IpcFrame> frame;
        if (size > kIpcLengthPrefix) {
            frame = decodeFrameBody(reinterpret_cast<const uint8_t*>(bytes.data()) + kIpcLengthPrefix,
                                    size - kIpcLengthPrefix);
        }
        frames_.push_back(std::move(frame));
    }
    ::close(report[0]);
}

HeldConnections::~HeldConnections() {
    if (release_ >= 0) ::close(release_);  // the child's read returns: it exits
    if (pid_ > 0) {
        int status;
        while (::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
        }
    }
}

size_t HeldConnections::replies() const {
    size_t n = 0;
    for (const auto& f : frames_) n += f && f->messageId == 1;
    return n;
}

size_t HeldConnections::refusals() const {
    size_t n = 0;
    for (const auto& f : frames_) n += f && f->messageId == kIpcNoticeMessageId && f->body.find(kIpcRefusalKey);
    return n;
}

int runProgramAs(uid_t uid, const std::vector<std::string>& argv, std::string* err) {
    int pipeFds[2];
    if (::pipe2(pipeFds, O_CLOEXEC) != 0) return -1;
    std::vector<char*> args;
    for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    const pid_t pid = ::fork();
    if (pid == 0) {
        becomeUser(uid);
        ::dup2(pipeFds[1], 2);
        const int null = ::open("/dev/null", O_WRONLY);
        ::dup2(null, 1);
        ::execv(args[0], args.data());
        ::_exit(127);
    }
    ::close(pipeFds[1]);
    char buffer[4096];
    for (;;) {
        const ssize_t n = ::read(pipeFds[0], buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        if (err) err->append(buffer, static_cast<size_t>(n));
    }
    ::close(pipeFds[0]);
    int status = 0;
    while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

}  // namespace vsl::test
