// The first thing a newcomer tries: a daemon on a scratch root, without root
// privileges, and commands from vesselctl.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "Daemon/Service/VSLStartup.h"
#include "Platform/NamedSemaphore.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl::test;

namespace {

// The prefix that runs a program as `uid` (same gid, no other groups) when the suite
// runs as root; nothing otherwise, as the suite's own user is already unprivileged.
std::vector<std::string> asUser(uid_t uid) {
    if (::geteuid() != 0) return {};
    std::string id = std::to_string(uid);
    return {"/usr/bin/setpriv", "--reuid=" + id, "--regid=" + id, "--clear-groups"};
}

// `vesseld --root ROOT --init` under `prefix`, stopped with SIGTERM at the latest
// when the test leaves, whichever way.
class Daemon {
public:
    Daemon(const std::vector<std::string>& prefix, const std::string& root) {
        std::vector<std::string> args = prefix;
        for (std::string a : {vesseldPath(), std::string("--root"), root, std::string("--init")}) args.push_back(a);
        pid_ = ::fork();
        if (pid_ == 0) {
            std::vector<char*> argv;
            for (auto& s : args) argv.push_back(s.data());
            argv.push_back(nullptr);
            ::setenv("VESSELD_OSLOG", "off", 1);
            ::execv(argv[0], argv.data());
            ::_exit(127);
        }
    }
    ~Daemon() { stop(); }

    // The exit status, or -1.
    int stop() {
        if (pid_ <= 0) return -1;
        ::kill(pid_, SIGTERM);
        int ws = 0;
        ::waitpid(pid_, &ws, 0);
        pid_ = -1;
        return WIFEXITED(ws) ? WEXITSTATUS(ws) : -1;
    }

private:
    pid_t pid_ = -1;
};

// vesselctl under `prefix`, retried while the daemon is still starting (exit 3).
int runCtl(const std::vector<std::string>& prefix, const std::string& root, const std::vector<std::string>& args,
           std::string* out) {
    std::vector<std::string> ctl = prefix;
    ctl.push_back(vesselctlPath());
    ctl.push_back("--root");
    ctl.push_back(root);
    ctl.insert(ctl.end(), args.begin(), args.end());
    std::string err;
    int status = -1;
    for (int i = 0; i < 200; i++) {
        status = runProgram(ctl, out, &err);
        if (status != 3) break;
        std::this_thread::sleep_for(std::chrono::milliseconds(25));
    }
    *out += err;
    return status;
}

// Declared before the daemon, so the daemon stops before its root goes.
struct RemovedOnExit {
    std::string path;
    ~RemovedOnExit() {
        // The first-boot marker of a daemon on a root below it goes too.
        std::error_code ec;
        for (const auto& entry : std::filesystem::directory_iterator(path, ec))
            vsl::removeSemaphore(vsl::semaphoreNameForSystemRoot(vsl::kFirstBootSemaphoreBase, entry.path()));
        removeTree(path);
    }
};

std::string lineValue(const std::string& out, const std::string& key) {
    auto at = out.find(key + ": ");
    if (at == std::string::npos) return {};
    at += key.size() + 2;
    return out.substr(at, out.find('\n', at) - at);
}

}  // namespace

TEST(Newcomer, InitThenPersonaUniqueStringsWithoutRoot) {
    if (::geteuid() == 0 && ::access("/usr/bin/setpriv", X_OK) != 0) GTEST_SKIP() << "needs setpriv to drop root";
    auto prefix = asUser(65534);
    std::string parent = makeTempDir("vessel-newcomer-");
    RemovedOnExit removed{parent};
    std::string root = parent + "/x";
    ::chmod(parent.c_str(), 0777);

    Daemon daemon(prefix, root);
    std::string out;
    EXPECT_EQ(0, runCtl(prefix, root, {"personaUniqueStrings"}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("ReplyError: 1\n")) << out;
    EXPECT_NE(std::string::npos, out.find("ReplyPersonaUniqueStringsArray")) << out;
    for (const char* c : {"1", "12"}) {
        std::string made;
        EXPECT_EQ(0, runCtl(prefix, root,
                            {"createOrLookup", "Identifier=com.example.first", std::string("ContainerClass=") + c,
                             "CreateIfNecessary=true"},
                            &made))
            << "class " << c << ": the owners --init wrote can be given: " << made;
    }

    struct stat st;
    ASSERT_EQ(0, ::stat(root.c_str(), &st));
    if (!prefix.empty()) {
        EXPECT_EQ(65534u, st.st_uid) << "everything was made by the unprivileged user";
    }
    EXPECT_EQ(0, daemon.stop()) << "SIGTERM ends it cleanly";
}

// Bundle, data, group and system containers alike: the defaults of --init give every
// owner to the invoking user, and what it still cannot give falls back to itself.
TEST(Newcomer, EveryClassWithoutRoot) {
    if (::geteuid() == 0 && ::access("/usr/bin/setpriv", X_OK) != 0) GTEST_SKIP() << "needs setpriv to drop root";
    const uid_t user = ::geteuid() == 0 ? 501 : ::geteuid();
    auto prefix = asUser(user);
    std::string parent = makeTempDir("vessel-newcomer-");
    RemovedOnExit removed{parent};
    ASSERT_EQ(0, ::chown(parent.c_str(), user, user));
    std::string root = parent + "/x";
    // No owners in the device facts: their defaults serve.
    std::string out, err;
    ASSERT_EQ(0, runProgram({"/bin/mkdir", "-p", root + "/etc/vesseld"}, &out, &err)) << err;
    std::ofstream(root + "/etc/vesseld/device.plist")
        << "<plist version=\"1.0\"><dict><key>MultiUser</key><false/></dict></plist>\n";
    ASSERT_EQ(0, runProgram({"/bin/chown", "-R", std::to_string(user) + ":" + std::to_string(user), root}, &out, &err))
        << err;

    Daemon daemon(prefix, root);
    for (int c = 1; c <= 13; c++) {
        SCOPED_TRACE("class " + std::to_string(c));
        std::string identifier = "com.example.newcomer" + std::to_string(c);
        std::string out;
        EXPECT_EQ(0, runCtl(prefix, root,
                            {"createOrLookup", "Identifier=" + identifier, "ContainerClass=" + std::to_string(c),
                             "CreateIfNecessary=true"},
                            &out))
            << out;
        EXPECT_EQ("1", lineValue(out, "ReplyError")) << out;
        std::string path = lineValue(out, "ReplyPath");
        struct stat st;
        ASSERT_EQ(0, ::stat(path.c_str(), &st)) << out;
        EXPECT_EQ(user, st.st_uid);
        if (c == 12 || c == 13) {
            EXPECT_EQ(0775u, st.st_mode & 07777) << "the group's ACL shows in the group bits";
            ASSERT_EQ(0, ::stat((path + "/Library/Caches").c_str(), &st)) << "the whole skeleton is there";
            EXPECT_EQ(user, st.st_uid);
            EXPECT_EQ(0700u, st.st_mode & 07777) << "only the daemon's user, as only root otherwise";
        }

        std::string again;
        EXPECT_EQ(0, runCtl(prefix, root,
                            {"createOrLookup", "Identifier=" + identifier, "ContainerClass=" + std::to_string(c)},
                            &again))
            << again;
        EXPECT_EQ(path, lineValue(again, "ReplyPath")) << again;
    }
    EXPECT_EQ(0, daemon.stop());

    std::string log = readFile(root + "/private/var/root/Library/Logs/Vesselry/vesseld.log");
    size_t first = log.find("Running without root");
    if (user != 0) {
        EXPECT_NE(std::string::npos, first) << log;
        EXPECT_EQ(std::string::npos, log.find("Running without root", first + 1)) << "logged once";
    }
}
