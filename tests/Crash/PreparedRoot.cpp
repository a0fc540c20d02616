// The root every kill point starts from: one container of each class family with
// files in it, the containers the deletion scenarios act on, and a data container
// whose user data is a tree of a few hundred items at protection class 3.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <unistd.h>

#include <cstdlib>
#include <fstream>

#include "Client/VSLContainerInfo.h"
#include "Client/VSLProtection.h"
#include "Crash/CrashSweep.h"
#include "Platform/ProtectionClass.h"
#include "Platform/SystemRoot.h"
#include "Support/TempRoot.h"

namespace vsl::test {

const char* const kTarget = "com.example.target";
const char* const kProtected = "com.example.protected";
const char* const kStagedPrefix = "com.example.staged.";

namespace {

constexpr int kTreeDirectories = 14;
constexpr int kTreeFiles = 25;  // per directory

std::string relativeTo(const std::string& root, const std::string& path) {
    return path.compare(0, root.size() + 1, root + "/") == 0 ? path.substr(root.size() + 1) : path;
}

void writeText(const std::string& path, const std::string& text) {
    ::mkdir(parentPath(path).c_str(), 0755);
    std::ofstream(path, std::ios::trunc) << text;
}

void setClass(const std::string& path, int protectionClass) {
    std::string text = std::to_string(protectionClass);
    EXPECT_EQ(0, ::lsetxattr(path.c_str(), protectionClassAttributeName(), text.data(), text.size(), 0)) << path;
}

void build(PreparedRoot& p) {
    p.daemon = std::make_unique<DaemonProcess>();
    DaemonProcess& d = *p.daemon;
    ASSERT_TRUE(d.registerProgram("/proc/self/exe", "sweeper", "com.example.sweeper",
                                  dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)},
                                        {"com.tarrow.private.Vesselry.deleteContainerContent", Value::boolean(true)},
                                        {"com.tarrow.private.Vesselry.testability", Value::boolean(true)}})));
    ASSERT_TRUE(d.start()) << readFile(d.at("vesseld.stderr"));
    auto connection = client::VSLConnection::connect(d.socketPath());
    ASSERT_TRUE(connection);

    const std::vector<std::pair<std::string, uint64_t>> made = {
        {"com.example.keep", 2},          {"com.example.plugin.keep", 4},     {"group.com.example.keep", 7},
        {"com.example.system.keep", 12},  {"systemgroup.com.example.keep", 13}, {kTarget, 2},
        {std::string(kStagedPrefix) + "1", 2}, {std::string(kStagedPrefix) + "2", 4},
        {std::string(kStagedPrefix) + "3", 2}, {kProtected, 2},
    };
    for (const auto& [identifier, containerClass] : made) {
        auto r = connection->sendRequest(createRequest(identifier, containerClass), std::chrono::seconds(30));
        ASSERT_EQ(1u, client::replyCode(r)) << identifier;
        KnownContainer c;
        c.identifier = identifier;
        c.containerClass = containerClass;
        if (const Value* u = r.body.find("ReplyUUID"); u && u->uuidValue()) c.uuid = u->uuidValue()->string();
        if (const Value* v = r.body.find("ReplyPath"); v && v->stringValue()) c.path = relativeTo(d.root(), *v->stringValue());
        ASSERT_FALSE(c.uuid.empty() || c.path.empty()) << identifier;
        if (identifier != kProtected) {
            c.files = {{"crash-payload.txt", identifier + " payload"},
                       {"crash-payload/inner.txt", "inner of " + identifier}};
            for (const auto& [name, text] : c.files) writeText(d.at(joinPath(c.path, name)), text);
        }
        p.containers.push_back(c);
    }

    // Files at class 3 in directories that the change to class 3 below re-classes: a
    // change to class 1 then re-classes every item.
    const KnownContainer& prot = *p.find(kProtected);
    std::string tree = joinPath(prot.path, "Documents/tree");
    ::mkdir(d.at(tree).c_str(), 0755);
    p.protectedItems.push_back(tree);
    for (int i = 0; i < kTreeDirectories; i++) {
        std::string dir = joinPath(tree, "d" + std::to_string(i));
        ::mkdir(d.at(dir).c_str(), 0755);
        p.protectedItems.push_back(dir);
        for (int j = 0; j < kTreeFiles; j++) {
            std::string file = joinPath(dir, "f" + std::to_string(j));
            writeText(d.at(file), file);
            setClass(d.at(file), 3);
            p.protectedItems.push_back(file);
        }
    }
    auto r = connection->sendRequest(client::setDataProtectionRequest({kProtected, 2, 3, false, false}),
                                     std::chrono::seconds(60));
    ASSERT_EQ(1u, client::replyCode(r)) << "the tree at class 3";
    connection.reset();
    ASSERT_EQ(0, d.stop());
}

}  // namespace

const KnownContainer* PreparedRoot::find(const std::string& identifier) const {
    for (const auto& c : containers)
        if (c.identifier == identifier) return &c;
    return nullptr;
}

const PreparedRoot& preparedRoot() {
    static PreparedRoot prepared = [] {
        // Every kill point copies a root and removes it: on a memory file system that
        // is nearly free, on a disk mounted with discard each unlink waits. The sweep
        // checks the order of writes, which does not depend on the file system.
        struct stat st;
        if (!std::getenv("VESSEL_CRASH_TMPDIR") && ::stat("/dev/shm", &st) == 0 && S_ISDIR(st.st_mode) &&
            ::access("/dev/shm", W_OK) == 0)
            ::setenv("TMPDIR", "/dev/shm", 1);
        PreparedRoot p;
        build(p);
        return p;
    }();
    return prepared;
}

Value createRequest(const std::string& identifier, uint64_t containerClass, bool transient, bool create) {
    return dict({{"Command", Value::uint64(0)},
                 {"Identifier", Value::string(identifier)},
                 {"ContainerClass", Value::uint64(containerClass)},
                 {"CreateIfNecessary", Value::boolean(create)},
                 {"Transient", Value::boolean(transient)}});
}

}  // namespace vsl::test
