// End to end: who owns a new container comes from the device facts, and the
// daemon's sandbox table follows its system root and leaves no temporaries.
#include <gtest/gtest.h>
#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <map>

#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

std::string replyPath(const DaemonProcess::CtlResult& r) {
    const Value* v = r.reply.find("ReplyPath");
    return v && v->stringValue() ? *v->stringValue() : std::string();
}

DaemonProcess::CtlResult create(const DaemonProcess& daemon, const std::string& identifier, int c) {
    return daemon.run(vesselctlPath(), {"createOrLookup", "Identifier=" + identifier,
                                        "ContainerClass=" + std::to_string(c), "CreateIfNecessary=true"});
}

std::vector<std::string> entries(const std::string& dir) {
    std::vector<std::string> names;
    if (DIR* d = ::opendir(dir.c_str())) {
        while (auto* e = ::readdir(d))
            if (std::string(e->d_name) != "." && std::string(e->d_name) != "..") names.push_back(e->d_name);
        ::closedir(d);
    }
    return names;
}

}  // namespace

TEST(ContainerOwners, ComeFromTheDeviceFacts) {
    if (::geteuid() != 0) GTEST_SKIP() << "giving owners needs root (the unprivileged case is the newcomer's)";
    DaemonProcess daemon;
    std::string facts = daemon.at("etc/vesseld/device.plist");
    ASSERT_EQ(0, std::system(("mkdir -p '" + daemon.at("etc/vesseld") + "'").c_str()));
    std::ofstream(facts) << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
                            "<plist version=\"1.0\"><dict>"
                            "<key>InstallerUID</key><integer>77</integer>"
                            "<key>SystemContainerUID</key><integer>78</integer>"
                            "</dict></plist>\n";
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));

    struct stat st;
    for (int c : {1, 3, 5, 8}) {
        auto r = create(daemon, "com.example.bundle", c);
        ASSERT_EQ(1u, r.code()) << c << r.err;
        ASSERT_EQ(0, ::stat(replyPath(r).c_str(), &st));
        EXPECT_EQ(77u, st.st_uid) << "class " << c << ": the installer of the device facts";
        EXPECT_EQ(77u, st.st_gid) << "class " << c;
    }
    for (int c : {12, 13}) {
        auto r = create(daemon, "com.example.system", c);
        ASSERT_EQ(1u, r.code()) << c << r.err;
        std::string path = replyPath(r);
        ASSERT_EQ(0, ::stat(path.c_str(), &st));
        EXPECT_EQ(78u, st.st_uid) << "class " << c << ": the system-container uid of the device facts";
        ASSERT_EQ(0, ::stat((path + "/Library/Preferences").c_str(), &st));
        EXPECT_EQ(4294967294u, st.st_uid) << "class " << c << ": root gives skeletons to nobody";
        EXPECT_EQ(0u, st.st_mode & 07777);
    }
    auto data = create(daemon, "com.example.data", 2);
    ASSERT_EQ(1u, data.code()) << data.err;
    ASSERT_EQ(0, ::stat(replyPath(data).c_str(), &st));
    EXPECT_EQ(501u, st.st_uid) << "a data container belongs to its user (mobile for a root caller)";
}

// The table keeps its items across restarts, so a copy of a root made while the
// daemon was stopped must not answer with the original's paths.
TEST(SandboxTable, ACopiedRootAnswersWithItsOwnPaths) {
    DaemonProcess original;
    ASSERT_TRUE(original.start()) << readFile(original.at("vesseld.stderr"));
    std::map<int, std::string> paths;
    for (int c : {2, 7, 12, 13}) {
        auto r = create(original, "com.example.moved", c);
        ASSERT_EQ(1u, r.code()) << c << r.err;
        paths[c] = replyPath(r);
        ASSERT_EQ(0u, paths[c].find(original.root() + "/")) << paths[c];
    }
    ASSERT_EQ(0, original.stop());

    DaemonProcess copy;
    std::string out, err;
    ASSERT_EQ(0, runProgram({"/bin/cp", "-a", original.root() + "/.", copy.root()}, &out, &err)) << err;
    ::unlink(copy.socketPath().c_str());
    ASSERT_TRUE(copy.start()) << readFile(copy.at("vesseld.stderr"));
    for (int c : {2, 7, 12, 13}) {
        auto r = copy.run(vesselctlPath(), {"createOrLookup", "Identifier=com.example.moved",
                                            "ContainerClass=" + std::to_string(c)});
        ASSERT_EQ(1u, r.code()) << c << r.err;
        EXPECT_EQ(copy.root() + paths[c].substr(original.root().size()), replyPath(r)) << "class " << c;
    }
}

TEST(SandboxTable, TemporariesOfAnInterruptedWriteGoAtStart) {
    DaemonProcess daemon;
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    ASSERT_EQ(1u, create(daemon, "com.example.kept", 12).code());
    ASSERT_EQ(0, daemon.stop());

    // What a kill between the write of a table's new copy and its rename leaves.
    std::string dir = daemon.at("run/vesseld/sandbox");
    auto before = entries(dir);
    ASSERT_EQ(std::vector<std::string>{"uid-0"}, before);
    std::string table = readFile(dir + "/uid-0");
    std::string leftover = dir + "/.uid-0.tmp-0F0B5A3C-5D1E-4C57-9A0E-3E1C2A7D9B11";
    std::ofstream(leftover) << table;
    std::ofstream(dir + "/.uid-501.tmp-0F0B5A3C-5D1E-4C57-9A0E-3E1C2A7D9B12") << "half";

    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    EXPECT_EQ(std::vector<std::string>{"uid-0"}, entries(dir)) << "only the table itself is left";
    auto r = daemon.run(vesselctlPath(), {"createOrLookup", "Identifier=com.example.kept", "ContainerClass=12"});
    EXPECT_EQ(1u, r.code()) << r.err;
}
