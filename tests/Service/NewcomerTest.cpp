// The first thing a newcomer tries: a daemon on a scratch root, without root
// privileges, and one command from vesselctl.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <thread>

#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl::test;

TEST(Newcomer, InitThenPersonaUniqueStringsWithoutRoot) {
    std::vector<std::string> asUser;
    if (::geteuid() == 0) {
        if (::access("/usr/bin/setpriv", X_OK) != 0) GTEST_SKIP() << "needs setpriv to drop root";
        asUser = {"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"};
    }
    std::string parent = makeTempDir("vessel-newcomer-");
    std::string root = parent + "/x";
    ::chmod(parent.c_str(), 0777);

    std::vector<std::string> daemonArgs = asUser;
    for (std::string a : {vesseldPath(), std::string("--root"), root, std::string("--init")}) daemonArgs.push_back(a);
    pid_t pid = ::fork();
    if (pid == 0) {
        std::vector<char*> argv;
        for (auto& s : daemonArgs) argv.push_back(s.data());
        argv.push_back(nullptr);
        ::setenv("VESSELD_OSLOG", "off", 1);
        ::execv(argv[0], argv.data());
        ::_exit(127);
    }

    std::vector<std::string> ctl = asUser;
    ctl.push_back(vesselctlPath());
    for (const char* a : {"--root", root.c_str(), "personaUniqueStrings"}) ctl.push_back(a);
    int status = -1;
    std::string out, err;
    for (int i = 0; i < 200 && status != 0; i++) {
        status = runProgram(ctl, &out, &err);
        if (status != 0) std::this_thread::sleep_for(std::chrono::milliseconds(25));
    }
    EXPECT_EQ(0, status) << out << err;
    EXPECT_NE(std::string::npos, out.find("ReplyError: 1\n")) << out;
    EXPECT_NE(std::string::npos, out.find("ReplyPersonaUniqueStringsArray")) << out;

    struct stat st;
    ASSERT_EQ(0, ::stat(root.c_str(), &st));
    if (!asUser.empty()) {
        EXPECT_EQ(65534u, st.st_uid) << "everything was made by the unprivileged user";
    }

    ::kill(pid, SIGTERM);
    int ws = 0;
    ::waitpid(pid, &ws, 0);
    EXPECT_TRUE(WIFEXITED(ws) && WEXITSTATUS(ws) == 0) << "SIGTERM ends it cleanly";
    removeTree(parent);
}
