#include "Support/DaemonProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <thread>

#include "Client/VSLConnection.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Platform/NamedSemaphore.h"
#include "Support/Boot.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Support/TempRoot.h"

extern char** environ;

namespace vsl::test {

std::string vesseldPath() { return std::string(VESSEL_BUILD_DIR) + "/src/vesseld"; }
std::string vesselctlPath() { return std::string(VESSEL_BUILD_DIR) + "/src/vesselctl"; }

namespace {

std::string drain(int fd) {
    std::string out;
    char buf[65536];
    for (;;) {
        ssize_t n = ::read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        out.append(buf, static_cast<size_t>(n));
    }
    return out;
}

std::vector<char*> cStrings(std::vector<std::string>& v) {
    std::vector<char*> out;
    for (auto& s : v) out.push_back(s.data());
    out.push_back(nullptr);
    return out;
}

// getenv() takes the first entry of a name: a test's own settings come first.
std::vector<std::string> environmentWith(const std::vector<std::string>& extra) {
    std::vector<std::string> env(extra);
    // A suite run by the service manager must not send its daemons' lines to the journal.
    env.insert(env.end(), {"INVOCATION_ID=", "JOURNAL_STREAM="});
    for (char** e = environ; *e; e++) env.emplace_back(*e);
    env.emplace_back("VESSELD_OSLOG=off");
    return env;
}

}  // namespace

int runProgram(const std::vector<std::string>& argvIn, std::string* out, std::string* err,
               const std::vector<std::string>& extraEnvironment) {
    int outPipe[2], errPipe[2];
    if (::pipe2(outPipe, O_CLOEXEC) != 0 || ::pipe2(errPipe, O_CLOEXEC) != 0) return -1;
    std::vector<std::string> argv = argvIn;
    std::vector<std::string> env = environmentWith(extraEnvironment);
    auto cargv = cStrings(argv);
    auto cenv = cStrings(env);
    pid_t pid = ::fork();
    if (pid == 0) {
        ::dup2(outPipe[1], 1);
        ::dup2(errPipe[1], 2);
        ::execve(cargv[0], cargv.data(), cenv.data());
        ::_exit(127);
    }
    ::close(outPipe[1]);
    ::close(errPipe[1]);
    // Both pipes are read on their own so a chatty child cannot block on either.
    std::string e;
    std::thread errReader([&] { e = drain(errPipe[0]); });
    std::string o = drain(outPipe[0]);
    errReader.join();
    ::close(outPipe[0]);
    ::close(errPipe[0]);
    int status = 0;
    while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    if (out) *out = o;
    if (err) *err = e;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

// The marker's name is taken now: a static instance is destroyed at exit, after the
// digest library has torn itself down.
DaemonProcess::DaemonProcess() : root_(makeTempDir("vessel-e2e-")), marker_(firstBootMarkerName(*this)) {}

DaemonProcess::~DaemonProcess() {
    if (running()) kill();
    removeSemaphore(marker_);
    removeTree(root_);
}

std::string DaemonProcess::at(const std::string& relative) const { return joinPath(root_, relative); }

std::string DaemonProcess::socketPath() const { return at("run/vesseld/com.tarrow.vesseld"); }

bool DaemonProcess::start(const std::vector<std::string>& extraEnvironment, const std::function<bool()>& ready) {
    std::vector<std::string> argv = {vesseldPath(), "--root", root_, "--init"};
    std::vector<std::string> env = environmentWith(extraEnvironment);
    auto cargv = cStrings(argv);
    auto cenv = cStrings(env);
    std::string logPath = at("vesseld.stderr");
    pid_ = ::fork();
    if (pid_ == 0) {
        int fd = ::open(logPath.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
        if (fd >= 0) {
            ::dup2(fd, 1);
            ::dup2(fd, 2);
        }
        struct rlimit files = {descriptorLimit_, descriptorLimit_};
        if (descriptorLimit_ != 0 && ::setrlimit(RLIMIT_NOFILE, &files) != 0) ::_exit(126);
        ::execve(cargv[0], cargv.data(), cenv.data());
        ::_exit(127);
    }
    // Ready once a request gets a reply (start-up finishes before connections are taken).
    // Generous: a loaded two-core machine can take many seconds to start a process.
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    while (std::chrono::steady_clock::now() < deadline) {
        // Before the reaping check: a caller that waits for nothing reaps the exit itself.
        if (ready && ready()) return true;
        int status = 0;
        if (::waitpid(pid_, &status, WNOHANG) == pid_) {
            pid_ = -1;
            return false;
        }
        if (auto c = ready ? nullptr : client::VSLConnection::connect(socketPath(), nullptr)) {
            auto r = c->sendRequest(dict({{"Command", Value::uint64(27)}}), std::chrono::seconds(10));
            if (r.ok()) return true;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(ready ? 2 : 25));
    }
    return false;
}

int DaemonProcess::stop() {
    if (pid_ <= 0) return -1;
    ::kill(pid_, SIGTERM);
    int status = 0;
    while (::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
    }
    pid_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

void DaemonProcess::kill() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGKILL);
    int status = 0;
    while (::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
    }
    pid_ = -1;
}

int DaemonProcess::waitForExit(std::chrono::milliseconds timeout) {
    if (pid_ <= 0) return -1;
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
        int status = 0;
        if (::waitpid(pid_, &status, WNOHANG) == pid_) {
            pid_ = -1;
            return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
        }
        if (std::chrono::steady_clock::now() >= deadline) return -1;
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
}

std::string DaemonProcess::addClient(const std::string& name, const std::string& signingIdentifier,
                                     const Value& entitlements, bool sandboxed) {
    std::string binDir = at("clients");
    ::mkdir(binDir.c_str(), 0755);
    std::string path = binDir + "/" + name;
    {
        std::ifstream in(vesselctlPath(), std::ios::binary);
        std::ofstream out(path, std::ios::binary | std::ios::trunc);
        out << in.rdbuf();
    }
    ::chmod(path.c_str(), 0755);
    return registerProgram(path, name, signingIdentifier, entitlements, sandboxed) ? path : std::string();
}

bool DaemonProcess::registerProgram(const std::string& program, const std::string& name,
                                    const std::string& signingIdentifier, const Value& entitlements,
                                    bool sandboxed) {
    std::string dir = at("etc/vesseld/code-signatures");
    std::string mk = "mkdir -p '" + dir + "'";
    if (std::system(mk.c_str()) != 0) return false;
    char real[PATH_MAX];
    std::string exe = ::realpath(program.c_str(), real) ? real : program;
    VSLErrorRef error;
    bool written = VSL_writeToURL(dict({{"Executable", Value::string(exe)},
                                        {"SigningIdentifier", Value::string(signingIdentifier)},
                                        {"Entitlements", entitlements},
                                        {"Sandboxed", Value::boolean(sandboxed)}}),
                                  dir + "/" + name + ".plist", kVSLWriteAtomic, &error);
    ::chmod((dir + "/" + name + ".plist").c_str(), 0644);
    return written;
}

uint64_t DaemonProcess::CtlResult::code() const {
    const Value* c = reply.find("ReplyError");
    return c && c->uint64Value() ? *c->uint64Value() : 0;
}

std::string DaemonProcess::CtlResult::string(const char* key) const {
    const Value* v = reply.find(key);
    return v && v->stringValue() ? *v->stringValue() : std::string();
}

std::string DaemonProcess::CtlResult::uuid() const {
    const Value* v = reply.find("ReplyUUID");
    if (!v || !v->dataValue()) return {};
    auto u = Uuid::fromBytes(v->dataValue()->data(), v->dataValue()->size());
    return u ? u->string() : std::string();
}

bool DaemonProcess::CtlResult::existed() const {
    const Value* v = reply.find("ReplyExisted");
    return v && v->boolValue().value_or(false);
}

DaemonProcess::CtlResult DaemonProcess::run(const std::string& client, const std::vector<std::string>& args) const {
    std::vector<std::string> argv = {client, "--root", root_, "--plist"};
    argv.insert(argv.end(), args.begin(), args.end());
    CtlResult r;
    r.exitCode = runProgram(argv, &r.out, &r.err);
    if (!r.out.empty()) {
        if (auto v = decodePropertyList(r.out.data(), r.out.size(), nullptr)) r.reply = *v;
    }
    return r;
}

}  // namespace vsl::test
