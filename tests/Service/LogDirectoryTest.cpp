// The rotating log's directory is one of the daemon's own layout directories: made
// with protection class 4 like the caches and library, and a failure to make it is
// reported with its own message.
#include <gtest/gtest.h>
#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl::test;

namespace {

std::string protectionClass(const std::string& path) {
    char buf[16];
    for (const char* name : {"trusted.vessel.protection-class", "user.vessel.protection-class"}) {
        ssize_t n = ::getxattr(path.c_str(), name, buf, sizeof buf);
        if (n >= 0) return std::string(buf, static_cast<size_t>(n));
    }
    return "none";
}

}  // namespace

TEST(LogDirectory, MadeWithClassFourAndItsFailureIsReported) {
    {
        DaemonProcess daemon;
        ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
        std::string logs = daemon.at("private/var/root/Library/Logs/Vesselry");
        EXPECT_EQ("4", protectionClass(logs));
        // The caches directory is made by the start-up clean-up, which runs in the
        // background: wait for it (bounded), then compare.
        std::string caches = daemon.at("private/var/root/Library/Caches/com.tarrow.vesseld");
        for (int i = 0; i < 200 && protectionClass(caches) != "4"; i++) ::usleep(50 * 1000);
        EXPECT_EQ("4", protectionClass(caches)) << "the same class as the daemon's other directories";
        EXPECT_EQ(0, ::access((logs + "/vesseld.log").c_str(), F_OK));
    }
    {
        // A file where the directory should go: the daemon still serves, and says why
        // it has no log.
        DaemonProcess daemon;
        ASSERT_EQ(0, ::mkdir(daemon.at("private").c_str(), 0755));
        ASSERT_EQ(0, ::mkdir(daemon.at("private/var").c_str(), 0755));
        ASSERT_EQ(0, ::mkdir(daemon.at("private/var/root").c_str(), 0755));
        ASSERT_EQ(0, ::mkdir(daemon.at("private/var/root/Library").c_str(), 0755));
        int fd = ::open(daemon.at("private/var/root/Library/Logs").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
        ASSERT_GE(fd, 0);
        ::close(fd);
        ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
        EXPECT_EQ(1u, daemon.run(vesselctlPath(), {"createOrLookup", "ContainerClass=2", "CreateIfNecessary=true"})
                          .code());
        daemon.stop();
        std::string err = readFile(daemon.at("vesseld.stderr"));
        EXPECT_NE(std::string::npos,
                  err.find("Failed to create log directory at \"" +
                           daemon.at("private/var/root/Library/Logs/Vesselry") + "\""))
            << err;
    }
}
