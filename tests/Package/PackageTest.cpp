// The Debian packages of this build tree: what they hold, what they depend on, and
// that the programs and the library taken out of them work on a temporary root.
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

namespace vsl::test {
namespace {

const char* const kDpkgDeb = "/usr/bin/dpkg-deb";

// The one file of `dir` whose name starts with `prefix`.
std::string findFile(const std::string& dir, const std::string& prefix) {
    std::string found;
    if (DIR* d = ::opendir(dir.c_str())) {
        while (dirent* e = ::readdir(d))
            if (std::string(e->d_name).rfind(prefix, 0) == 0) found = dir + "/" + e->d_name;
        ::closedir(d);
    }
    return found;
}

// Every man page docs/man renders, as the package names it.
std::vector<std::string> manPages() {
    std::vector<std::string> pages;
    const std::string dir = std::string(VESSEL_SOURCE_DIR) + "/docs/man";
    if (DIR* d = ::opendir(dir.c_str())) {
        while (dirent* e = ::readdir(d)) {
            std::string name = e->d_name;
            if (name.size() < 6 || name.substr(name.size() - 3) != ".md") continue;
            name.resize(name.size() - 3);  // vesseld.8
            pages.push_back("./usr/share/man/man" + name.substr(name.size() - 1) + "/" + name + ".gz");
        }
        ::closedir(d);
    }
    return pages;
}

// The packaged path (as dpkg-deb --contents lists it, less the leading ".") that ends with `suffix`.
std::string packagedPath(const std::string& contents, const std::string& suffix) {
    std::istringstream lines(contents);
    std::string line;
    while (std::getline(lines, line)) {
        const size_t at = line.rfind(" ./");
        if (at == std::string::npos) continue;
        const std::string path = line.substr(at + 2);
        if (path.size() >= suffix.size() && path.compare(path.size() - suffix.size(), suffix.size(), suffix) == 0)
            return path;
    }
    return {};
}

class Scratch {
public:
    Scratch() : path(makeTempDir("vessel-package-")) {}
    ~Scratch() { removeTree(path); }
    const std::string path;
};

// A client built against the installed library: pings the daemon on the socket given.
const char* const kClientSource = R"(#include <chrono>
#include "Client/VSLConnection.h"
int main(int, char** argv) {
    auto c = vsl::client::VSLConnection::connect(argv[1], nullptr);
    if (!c) return 3;
    auto r = c->sendRequest(vsl::Value::dictionary({{"Command", vsl::Value::uint64(27)}}), std::chrono::seconds(30));
    return r.ok() ? 0 : 1;
}
)";

TEST(PackageTest, PackagesHoldTheirFilesAndWhatTheyHoldServesATemporaryRoot) {
#ifdef VESSEL_SANITIZED
    GTEST_SKIP() << "a sanitizer build is not packaged: its objects need the sanitizer runtime to link";
#endif
    if (::access(kDpkgDeb, X_OK) != 0) GTEST_SKIP() << kDpkgDeb << " is missing: the packages were not checked";
    Scratch scratch;
    const std::string out = scratch.path + "/out";
    std::string log, err;
    ASSERT_EQ(0, runProgram({VESSEL_CPACK, "-G", "DEB", "-B", out, "--config",
                             std::string(VESSEL_BUILD_DIR) + "/CPackConfig.cmake"},
                            &log, &err))
        << log << err;
    const std::string daemonDeb = findFile(out, "vesseld_");
    const std::string devDeb = findFile(out, "libvessel-dev_");
    ASSERT_FALSE(daemonDeb.empty()) << log;
    ASSERT_FALSE(devDeb.empty()) << log;

    std::string contents;
    ASSERT_EQ(0, runProgram({kDpkgDeb, "--contents", daemonDeb}, &contents, &err)) << err;
    std::vector<std::string> expected = {"./usr/sbin/vesseld",
                                         "./usr/bin/vesselctl",
                                         "./usr/lib/systemd/system/vesseld.service",
                                         "./usr/lib/systemd/system/vesseld.socket",
                                         "./usr/lib/systemd/system/vesseld-upcall.socket",
                                         "./usr/lib/tmpfiles.d/vesseld.conf",
                                         "./etc/vesseld/device.plist",
                                         "./etc/vesseld/code-signatures/",
                                         "./usr/share/doc/vesseld/examples/vesselctl.plist"};
    for (const auto& page : manPages()) expected.push_back(page);
    for (const auto& path : expected) EXPECT_NE(std::string::npos, contents.find(" " + path + "\n")) << path;
    std::string depends;
    runProgram({kDpkgDeb, "--field", daemonDeb, "Depends"}, &depends, &err);
    for (const char* library : {"libc6", "libplist", "libacl1", "libsqlite3"})
        EXPECT_NE(std::string::npos, depends.find(library)) << "shlibdeps names " << library << ": " << depends;
    // The daemon speaks to the service manager and hashes on its own: these would cost megabytes of idle memory.
    for (const char* library : {"libsystemd", "libssl"})
        EXPECT_EQ(std::string::npos, depends.find(library)) << "depends on " << library << ": " << depends;

    ASSERT_EQ(0, runProgram({kDpkgDeb, "--contents", devDeb}, &contents, &err)) << err;
    for (const char* path : {"/usr/include/vessel/Client/VSLConnection.h", "/usr/include/vessel/Platform/Value.h",
                             "/libvessel.a", "/pkgconfig/vessel.pc"})
        EXPECT_NE("", packagedPath(contents, path)) << path;
    const std::string pkgconfigFile = packagedPath(contents, "/pkgconfig/vessel.pc");

    // Both packages unpacked into one tree, as they would be installed.
    const std::string tree = scratch.path + "/tree";
    ASSERT_EQ(0, runProgram({kDpkgDeb, "-x", daemonDeb, tree}, &log, &err)) << err;
    ASSERT_EQ(0, runProgram({kDpkgDeb, "-x", devDeb, tree}, &log, &err)) << err;

    // The packaged example configuration is the root's own.
    const std::string root = scratch.path + "/root";
    ASSERT_EQ(0, runProgram({"/bin/mkdir", "-p", root + "/etc/vesseld"}, &log, &err));
    ASSERT_EQ(0, runProgram({"/bin/cp", tree + "/etc/vesseld/device.plist", root + "/etc/vesseld/"}, &log, &err));
    const std::string daemonOut = scratch.path + "/vesseld.out";
    const pid_t daemon = ::fork();
    if (daemon == 0) {
        const int fd = ::open(daemonOut.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
        ::dup2(fd, 1);
        ::dup2(fd, 2);
        const std::string program = tree + "/usr/sbin/vesseld";
        ::execl(program.c_str(), program.c_str(), "--root", root.c_str(), "--init", static_cast<char*>(nullptr));
        ::_exit(127);
    }
    // The packaged vesselctl, given its entitlement by --init, creates a container.
    DaemonProcess::CtlResult made;
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    do {
        made.exitCode = runProgram({tree + "/usr/bin/vesselctl", "--root", root, "createOrLookup",
                                    "Identifier=com.example.packaged", "ContainerClass=2", "CreateIfNecessary=true"},
                                   &made.out, &made.err);
        if (made.exitCode != 3) break;  // 3: no daemon answering yet
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    } while (std::chrono::steady_clock::now() < deadline);
    EXPECT_EQ(0, made.exitCode) << made.out << made.err << readFile(daemonOut);
    EXPECT_NE(std::string::npos, made.out.find("ReplyPath")) << made.out;

    // A program built against the packaged library and pkg-config file talks to it too.
    const std::string source = scratch.path + "/client.cpp";
    std::ofstream(source) << kClientSource;
    const std::string pkgconfigDir = tree + pkgconfigFile.substr(0, pkgconfigFile.rfind('/'));
    const std::string build = "c++ -std=c++20 -o '" + scratch.path + "/client' '" + source +
                              "' $(PKG_CONFIG_PATH='" + pkgconfigDir + "' pkg-config --cflags --libs vessel)";
    std::string compilerOut;
    const int compiled = runProgram({"/bin/sh", "-c", build}, &compilerOut, &err);
    EXPECT_EQ(0, compiled) << build << "\n" << compilerOut << err;
    if (compiled == 0) {
        EXPECT_EQ(0, runProgram({scratch.path + "/client", root + "/run/vesseld/com.tarrow.vesseld"}, &log, &err))
            << log << err;
    }

    ::kill(daemon, SIGTERM);
    int status = 0;
    while (::waitpid(daemon, &status, 0) < 0 && errno == EINTR) {
    }
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << readFile(daemonOut);
    const std::string daemonLog = readFile(root + "/private/var/root/Library/Logs/Vesselry/vesseld.log");
    EXPECT_EQ(std::string::npos, daemonLog.find("device.plist")) << "the example configuration reads cleanly\n"
                                                                  << daemonLog;
}

}  // namespace
}  // namespace vsl::test
