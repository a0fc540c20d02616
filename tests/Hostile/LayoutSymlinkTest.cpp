// A local user who owns a home directory tries to make the daemon act outside it:
// directories of the layout and of a container skeleton swapped for symbolic links
// to a root-owned directory elsewhere. Whatever the daemon answers, that directory
// must come out exactly as it went in.
#include <gtest/gtest.h>
#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <map>
#include <set>
#include <thread>

#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

constexpr uid_t kUser = 501;

// What the daemon could have changed about a directory.
struct Snapshot {
    uid_t uid = 0;
    gid_t gid = 0;
    mode_t mode = 0;
    std::map<std::string, std::string> xattrs;
    std::set<std::string> entries;
    bool operator==(const Snapshot&) const = default;
};

std::ostream& operator<<(std::ostream& os, const Snapshot& s) {
    os << "owner " << s.uid << ":" << s.gid << " mode " << std::oct << s.mode << std::dec << " xattrs {";
    for (const auto& [k, v] : s.xattrs) os << k << "=" << v << " ";
    os << "} entries {";
    for (const auto& e : s.entries) os << e << " ";
    return os << "}";
}

Snapshot snapshot(const std::string& dir) {
    Snapshot s;
    struct stat st;
    if (::lstat(dir.c_str(), &st) != 0) return s;
    s.uid = st.st_uid;
    s.gid = st.st_gid;
    s.mode = st.st_mode;
    char names[4096];
    ssize_t n = ::llistxattr(dir.c_str(), names, sizeof names);
    for (ssize_t i = 0; i < n; i += static_cast<ssize_t>(std::strlen(names + i)) + 1) {
        char value[256];
        ssize_t m = ::lgetxattr(dir.c_str(), names + i, value, sizeof value);
        s.xattrs[names + i] = m < 0 ? std::string("?") : std::string(value, static_cast<size_t>(m));
    }
    if (DIR* d = ::opendir(dir.c_str())) {
        while (dirent* e = ::readdir(d))
            if (std::strcmp(e->d_name, ".") != 0 && std::strcmp(e->d_name, "..") != 0) s.entries.insert(e->d_name);
        ::closedir(d);
    }
    return s;
}

void chownTree(const std::string& path, uid_t uid) {
    ASSERT_EQ(0, ::lchown(path.c_str(), uid, uid)) << path;
    DIR* d = ::opendir(path.c_str());
    if (!d) return;
    while (dirent* e = ::readdir(d)) {
        if (std::strcmp(e->d_name, ".") == 0 || std::strcmp(e->d_name, "..") == 0) continue;
        std::string child = path + "/" + e->d_name;
        struct stat st;
        if (::lstat(child.c_str(), &st) == 0 && S_ISDIR(st.st_mode))
            chownTree(child, uid);
        else
            ASSERT_EQ(0, ::lchown(child.c_str(), uid, uid)) << child;
    }
    ::closedir(d);
}

class HostileUser : public ::testing::Test {
protected:
    void SetUp() override {
        if (::geteuid() != 0) GTEST_SKIP() << "needs root: the daemon must be privileged for a user to attack it";
        admin = daemon.addClient("admin", "com.example.admin",
                                 dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)}}));
        ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
        home = daemon.at("private/var/mobile");
        // The layout exists (normal and transient) before the user gets at it.
        ASSERT_EQ(1u, create("com.example.first").code());
        ASSERT_EQ(1u, create("com.example.first-transient", true).code());
        chownTree(home, kUser);

        outside = makeTempDir("vessel-outside-");
        ASSERT_EQ(0, ::chmod(outside.c_str(), 0751));
        ASSERT_EQ(0, ::setxattr(outside.c_str(), "user.marker", "kept", 4, 0));
        int keep = ::open((outside + "/keep").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
        ASSERT_GE(keep, 0);
        ::close(keep);
        before = snapshot(outside);
        ASSERT_EQ(0u, before.uid);
        ASSERT_EQ(1u, before.entries.size());
    }
    void TearDown() override {
        if (!outside.empty()) removeTree(outside);
    }

    DaemonProcess::CtlResult create(const std::string& identifier, bool transient = false) {
        std::vector<std::string> args = {"createOrLookup", "Identifier=" + identifier, "ContainerClass=2",
                                         "CreateIfNecessary=true"};
        if (transient) args.push_back("Transient=true");
        return daemon.run(admin, args);
    }

    // The user's move: `relative` (below the home) gives way to a link to `outside`.
    void swapForLink(const std::string& relative) {
        std::string path = home + "/" + relative;
        ASSERT_EQ(0, ::rename(path.c_str(), (path + ".real").c_str())) << path;
        ASSERT_EQ(0, ::symlink(outside.c_str(), path.c_str()));
        ASSERT_EQ(0, ::lchown(path.c_str(), kUser, kUser));
    }
    void restore(const std::string& relative) {
        std::string path = home + "/" + relative;
        ASSERT_EQ(0, ::unlink(path.c_str()));
        ASSERT_EQ(0, ::rename((path + ".real").c_str(), path.c_str()));
    }

    DaemonProcess daemon;
    std::string admin, home, outside;
    Snapshot before;
};

std::string str(const DaemonProcess::CtlResult& r, const char* key) {
    const Value* v = r.reply.find(key);
    return v && v->stringValue() ? *v->stringValue() : std::string();
}

}  // namespace

TEST_F(HostileUser, LayoutDirectoriesSwappedForLinksAreRefusedNotFollowed) {
    struct Case {
        const char* directory;
        bool transient;
    };
    const Case cases[] = {
        {"Containers", false},          {"Containers/Staging", false},
        {"Containers/Data", false},     {"Containers/Data/Application", false},
        {"Containers/Temp", true},      {"Containers/Temp/Data/Application", true},
    };
    int n = 0;
    for (const Case& c : cases) {
        SCOPED_TRACE(c.directory);
        swapForLink(c.directory);
        auto r = create("com.example.hostile" + std::to_string(n++), c.transient);
        EXPECT_NE(1u, r.code()) << "created at " << str(r, "ReplyPath");
        EXPECT_NE(0u, r.code()) << "no reply: " << r.err;
        EXPECT_EQ(before, snapshot(outside));
        restore(c.directory);
        // The real directory is still the user's and the daemon works again.
        struct stat st;
        ASSERT_EQ(0, ::lstat((home + "/" + c.directory).c_str(), &st));
        EXPECT_EQ(kUser, st.st_uid);
        EXPECT_EQ(1u, create("com.example.after" + std::to_string(n), c.transient).code());
    }
    std::string log = readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log"));
    EXPECT_NE(std::string::npos, log.find("Failed to create user base dir at")) << log;
    EXPECT_NE(std::string::npos, log.find("Too many levels of symbolic links")) << log;
}

TEST_F(HostileUser, SkeletonDirectorySwappedForLinkChangesNothingOutside) {
    // An existing container: its skeleton is the user's to play with.
    auto made = create("com.example.kept");
    ASSERT_EQ(1u, made.code());
    std::string container = str(made, "ReplyPath");
    chownTree(container, kUser);
    for (const char* sub : {"Library", "tmp"}) {
        std::string path = container + "/" + sub;
        ASSERT_EQ(0, ::rename(path.c_str(), (path + ".real").c_str()));
        ASSERT_EQ(0, ::symlink(outside.c_str(), path.c_str()));
    }
    auto again = create("com.example.kept");
    EXPECT_EQ(1u, again.code());
    EXPECT_EQ(container, str(again, "ReplyPath"));
    ASSERT_EQ(0, daemon.stop());
    ASSERT_TRUE(daemon.start());
    EXPECT_EQ(1u, create("com.example.kept").code());
    EXPECT_EQ(before, snapshot(outside));

    // A container being built: the user owns its staging directory as soon as it is
    // made and swaps the last skeleton directory for a link before the daemon gets
    // there. Stopping the daemon on the directory's creation stands in for winning
    // that race.
    // On a loaded machine the daemon may make the skeleton before the stop lands: that
    // attempt is lost and another identifier tries again.
    std::string staging = home + "/Containers/Staging";
    bool planted = false;
    for (int attempt = 0; attempt < 8 && !planted; attempt++) {
        int in = ::inotify_init1(IN_CLOEXEC);
        ASSERT_GE(in, 0);
        ASSERT_GE(::inotify_add_watch(in, staging.c_str(), IN_CREATE), 0);
        std::atomic<bool> linked{false}, done{false};
        std::thread user([&] {
            alignas(inotify_event) char buf[4096];
            while (!done) {
                pollfd p{in, POLLIN, 0};
                if (::poll(&p, 1, 100) <= 0) continue;
                ssize_t n = ::read(in, buf, sizeof buf);
                if (n <= 0) return;
                for (ssize_t i = 0; i < n;) {
                    auto* e = reinterpret_cast<inotify_event*>(buf + i);
                    i += static_cast<ssize_t>(sizeof(inotify_event) + e->len);
                    if (!(e->mask & IN_ISDIR) || e->len == 0) continue;
                    ::kill(daemon.pid(), SIGSTOP);
                    std::string link = staging + "/" + e->name + "/tmp";
                    if (::symlink(outside.c_str(), link.c_str()) == 0) {
                        ::lchown(link.c_str(), kUser, kUser);
                        linked = true;
                    }
                    ::kill(daemon.pid(), SIGCONT);
                    return;
                }
            }
        });
        std::string identifier = "com.example.raced" + std::to_string(attempt);
        auto raced = create(identifier);
        done = true;  // ends the reader if the daemon never made a directory
        user.join();
        ::close(in);
        planted = linked;
        if (planted) {
            EXPECT_NE(1u, raced.code()) << "created at " << str(raced, "ReplyPath");
            EXPECT_NE(0u, raced.code()) << raced.err;
        }
        EXPECT_EQ(before, snapshot(outside));
    }
    ASSERT_TRUE(planted) << "the link never went in before the daemon made its skeleton";
    EXPECT_EQ(1u, create("com.example.after-race").code());
}
