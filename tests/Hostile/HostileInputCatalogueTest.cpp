// Every kind of bad input a client or the kernel can send, sent the way they would
// send it: each must end in its error code, or for bytes that do not decode in a
// closed connection while other clients are still served, and nothing on disk may
// change, neither in the system root nor in a directory outside it that planted
// links point at.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstring>
#include <fstream>
#include <functional>
#include <optional>

#include "Client/VSLConnection.h"
#include "Client/VSLContainerInfo.h"
#include "Client/VSLUpcallClient.h"
#include "Client/VSLUpcallProtocol.h"
#include "Platform/IpcWire.h"
#include "Platform/PropertyList.h"
#include "Platform/UniqueFd.h"
#include "Support/DaemonProcess.h"
#include "Support/RootFiles.h"
#include "Support/TempRoot.h"
#include "Support/TreeSnapshot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

constexpr auto kWait = std::chrono::seconds(60);
constexpr uint64_t kClosed = 0;  // the expected outcome of bytes that do not decode
const char* const kApp = "com.example.hostile";
const char* const kGroup = "systemgroup.com.example.hostile";
const char* const kSystem = "com.example.hostile.system";

void sendRaw(int fd, const std::string& bytes) {
    for (size_t at = 0; at < bytes.size();) {
        ssize_t n = ::send(fd, bytes.data() + at, bytes.size() - at, MSG_NOSIGNAL);
        if (n <= 0) return;  // the daemon may hang up before it has read everything
        at += static_cast<size_t>(n);
    }
}

// Sends bytes on a connection of their own: the reply's code, or kClosed when the
// daemon hung up without one.
uint64_t exchangeRaw(const std::string& socketPath, const std::string& bytes) {
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, socketPath.c_str(), sizeof addr.sun_path - 1);
    if (::connect(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) return ~0ull;
    timeval patience{60, 0};
    ::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    sendRaw(fd.get(), bytes);
    std::string in;
    char buf[65536];
    for (;;) {
        if (in.size() >= kIpcLengthPrefix) {
            auto length = decodeFrameLength(reinterpret_cast<const uint8_t*>(in.data()));
            if (!length) return ~0ull;
            if (in.size() >= kIpcLengthPrefix + *length) {
                auto frame = decodeFrameBody(reinterpret_cast<const uint8_t*>(in.data()) + kIpcLengthPrefix, *length);
                const Value* code = frame ? frame->body.find("ReplyError") : nullptr;
                return code && code->uint64Value() ? *code->uint64Value() : ~0ull;
            }
        }
        ssize_t n = ::recv(fd.get(), buf, sizeof buf, 0);
        if (n == 0 || (n < 0 && errno == ECONNRESET)) return kClosed;
        if (n < 0) return ~0ull;  // timed out: a hang
        in.append(buf, static_cast<size_t>(n));
    }
}

// Hand-made wire bytes, for what the encoder refuses to produce.
struct Wire {
    std::string b;
    Wire& u32(uint32_t v) {
        for (int i = 0; i < 4; ++i) b.push_back(static_cast<char>(v >> (8 * i)));
        return *this;
    }
    Wire& text(const std::string& s) { return u32(static_cast<uint32_t>(s.size())), b += s, *this; }
    Wire& dictionary(uint32_t count) { return b.push_back(0x0B), u32(count); }
    Wire& string(const std::string& s) { return b.push_back(0x06), text(s); }
    Wire& uint64(uint64_t v) {
        b.push_back(0x03);
        for (int i = 0; i < 8; ++i) b.push_back(static_cast<char>(v >> (8 * i)));
        return *this;
    }
    // The frame around this body: length, magic, version, flags, message id.
    std::string frame(uint32_t extraLength = 0) const {
        Wire f;
        f.u32(static_cast<uint32_t>(kIpcHeaderLength + b.size()) + extraLength);
        f.b += "VSLM";
        f.b += std::string("\x01\x00\x00\x00", 4);
        f.u32(1).u32(0);
        return f.b + b;
    }
};

// A body of dictionaries nested `levels` deep (the body itself is level 1) asking command 27.
std::string nestedFrame(size_t levels) {
    Wire w;
    w.dictionary(2).text("Command").uint64(27);
    for (size_t level = 2; level <= levels; ++level) w.text("N").dictionary(level == levels ? 0 : 1);
    if (levels == 1) w.text("N").string("");
    return w.frame();
}

// A command-27 frame of exactly `length` bytes after its length prefix.
std::string frameOfLength(size_t length) {
    Wire w;
    w.dictionary(2).text("Command").uint64(27).text("Pad");
    const size_t fixed = kIpcHeaderLength + w.b.size() + 5;  // string tag and length
    w.string(std::string(length - fixed, 'x'));
    return w.frame();
}

Value u64(uint64_t v) { return Value::uint64(v); }
Value str(const std::string& s) { return Value::string(s); }

std::string identifierOfLength(size_t n) {
    std::string s = "com.example.";
    return s + std::string(n - s.size(), 'x');
}

class HostileInputCatalogue : public ::testing::Test {
protected:
    void SetUp() override {
        if (::geteuid() != 0) GTEST_SKIP() << "needs root: the daemon acts as the owner of every container";
        char exe[PATH_MAX];
        ASSERT_TRUE(::realpath("/proc/self/exe", exe));
        auto granted = dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)},
                             {"com.tarrow.private.Vesselry.userManagedAssets", Value::boolean(true)},
                             {"com.tarrow.private.Vesselry.stageSharedContent", Value::boolean(true)},
                             {"com.tarrow.private.Vesselry.deleteContainerContent", Value::boolean(true)},
                             {"com.tarrow.security.system-groups", Value::array({str(kGroup)})}});
        ASSERT_TRUE(daemon.registerProgram(exe, "tester", "com.example.tester", granted));
        ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
        std::string error;
        client = client::VSLConnection::connect(daemon.socketPath(), &error);
        bystander = client::VSLConnection::connect(daemon.socketPath(), &error);
        ASSERT_TRUE(client && bystander) << error;
        makeVictim();
    }
    void TearDown() override {
        if (!victim.empty()) removeTree(victim);
    }

    // A root-owned directory outside the system root with a bit of everything.
    void makeVictim() {
        victim = makeTempDir("vessel-victim-");
        ASSERT_EQ(0, ::chmod(victim.c_str(), 0751));
        ASSERT_EQ(0, ::mkdir((victim + "/dir").c_str(), 0700));
        std::ofstream(victim + "/file") << std::string(1 << 20, 'v');
        std::ofstream(victim + "/dir/precious") << "keep me";
        ASSERT_EQ(0, ::setxattr(victim.c_str(), "user.marker", "kept", 4, 0));
        // A POSIX ACL granting uid 501 read access: version 2, then (tag, perm, id) entries.
        Wire acl;
        acl.u32(2);
        for (auto [tag, perm, id] : {std::tuple{1u, 7u, ~0u}, {2u, 4u, 501u}, {4u, 5u, ~0u}, {0x10u, 5u, ~0u},
                                     {0x20u, 1u, ~0u}})
            acl.u32(tag | (perm << 16)).u32(id);
        ASSERT_EQ(0, ::setxattr((victim + "/dir").c_str(), "system.posix_acl_access", acl.b.data(), acl.b.size(), 0))
            << std::strerror(errno);
        victimBefore = snapshotTree(victim);
    }

    uint64_t send(Dictionary request, Value* reply = nullptr) {
        auto r = client->sendRequest(Value::dictionary(std::move(request)), kWait);
        if (reply) *reply = r.body;
        return r.ok() ? client::replyCode(r) : kClosed;
    }
    struct Made {
        std::string path;
        Value uuid;
    };
    Made create(const std::string& identifier, uint64_t containerClass) {
        Value reply;
        EXPECT_EQ(1u, send({{"Command", u64(0)}, {"Identifier", str(identifier)},
                            {"ContainerClass", u64(containerClass)}, {"CreateIfNecessary", Value::boolean(true)}},
                           &reply))
            << identifier;
        const Value* path = reply.find("ReplyPath");
        const Value* uuid = reply.find("ReplyUUID");
        return {path && path->stringValue() ? *path->stringValue() : std::string(), uuid ? *uuid : Value()};
    }
    void link(const std::string& target, const std::string& at) {
        ASSERT_EQ(0, ::symlink(target.c_str(), at.c_str())) << at;
    }

    // What the daemon changes by itself while it serves: its log and its database.
    TreeSnapshot rootState() {
        return snapshotTree(daemon.root(), [](const std::string& path) {
            return path.find("/Logs/Vesselry") != std::string::npos || path.find(".sqlite3") != std::string::npos ||
                   path == "/vesseld.stderr";
        });
    }

    DaemonProcess daemon;
    std::shared_ptr<client::VSLConnection> client, bystander;
    std::string victim;
    TreeSnapshot victimBefore;
};

struct Case {
    std::string what;
    std::function<uint64_t()> send;
    uint64_t code;
    // The operation succeeds and changes the root by design: only the outside is compared.
    bool rootMayChange = false;
};

}  // namespace

TEST_F(HostileInputCatalogue, EveryBadInputGetsItsCodeAndChangesNothing) {
    // Containers with links to the victim planted where the daemon walks.
    const Made madeApp = create(kApp, 2), madeSystem = create(kSystem, 12);
    const std::string app = madeApp.path, system = madeSystem.path;
    const std::string wiped = create("com.example.hostile.wiped", 2).path;
    const std::string deleted = create("com.example.hostile.deleted", 2).path;
    const std::string group = create(kGroup, 13).path;
    ASSERT_FALSE(app.empty() || wiped.empty() || deleted.empty() || group.empty() || system.empty());
    Value assetsReply;
    ASSERT_EQ(1u, send({{"Command", u64(28)}, {"Identifier", str(kApp)}, {"CreateIfNecessary", Value::boolean(true)}},
                       &assetsReply));
    const std::string assets = *assetsReply.find("ReplyPath")->stringValue();
    for (const std::string& c : {app, wiped, deleted, system}) {
        link(victim, c + "/victim");
        link(victim + "/file", c + "/Library/file");
    }
    // Skeleton directories that became links: re-creating the skeleton must not follow them.
    ASSERT_EQ(0, ::rename((app + "/tmp").c_str(), (app + "/tmp.real").c_str()));
    link(victim + "/dir", app + "/tmp");
    ASSERT_EQ(0, ::rename((system + "/Library").c_str(), (system + "/Library.real").c_str()));
    link(victim, system + "/Library");
    link(victim, assets + "/escape");
    link(victim + "/file", assets + "/escape-file");
    link("../../../../../../../..", assets + "/up");
    ASSERT_EQ(0, ::mkdir((group + "/Incoming").c_str(), 0755));
    ASSERT_EQ(0, ::mkdir((group + "/Incoming/tree").c_str(), 0755));
    link(victim, group + "/Incoming/out");
    link(victim, group + "/Incoming/tree/out");
    link(victim + "/file", group + "/Incoming/tree/file");
    // Containers may be called anything: their directories have UUID names. These
    // names only matter where an identifier becomes a file name.
    const std::string longName = identifierOfLength(4096);
    const std::string nameTooLong = identifierOfLength(250);  // fits alone, not with the file name's suffix
    for (const std::string& name : {std::string(".."), std::string("."), std::string("a/../../b"), longName, nameTooLong})
        ASSERT_FALSE(create(name, 2).path.empty()) << name.substr(0, 20);

    auto request = [&](Dictionary d) { return [this, d] { return send(d); }; };
    auto protect = [&](const std::string& identifier) {
        return request({{"Command", u64(21)}, {"Identifier", str(identifier)}, {"ContainerClass", u64(2)},
                        {"DataProtectionClass", Value::int64(3)}});
    };
    auto raw = [&](std::string bytes) { return [this, bytes] { return exchangeRaw(daemon.socketPath(), bytes); }; };
    const Value appUUID = madeApp.uuid, systemUUID = madeSystem.uuid;

    std::vector<Case> cases = {
        // Paths that climb out or start at the top, in every key that takes one.
        {"26 source with ..", request({{"Command", u64(26)}, {"Identifier", str(kGroup)},
                                       {"SourcePath", str("Incoming/../../..")}, {"DestPath", str("x")}}), 38},
        {"26 dest with ..", request({{"Command", u64(26)}, {"Identifier", str(kGroup)},
                                     {"SourcePath", str("Incoming/tree")}, {"DestPath", str("../x")}}), 38},
        // An absolute path names a path inside the container: the source is not there,
        // and the destination's parent is not (the source's ACLs are reset first).
        {"26 absolute source", request({{"Command", u64(26)}, {"Identifier", str(kGroup)},
                                        {"SourcePath", str(victim)}, {"DestPath", str("x")}}), 64},
        {"26 absolute dest", request({{"Command", u64(26)}, {"Identifier", str(kGroup)},
                                      {"SourcePath", str("Incoming/tree")}, {"DestPath", str(victim + "/x")}}), 64,
         true},
        {"26 source a link out", request({{"Command", u64(26)}, {"Identifier", str(kGroup)},
                                          {"SourcePath", str("Incoming/out")}, {"DestPath", str("x")}}), 10},
        {"26 dest through a link out", request({{"Command", u64(26)}, {"Identifier", str(kGroup)},
                                                {"SourcePath", str("Incoming/tree")},
                                                {"DestPath", str("Incoming/out/x")}}), 10},
        {"26 identifier with ..", request({{"Command", u64(26)}, {"Identifier", str("../" + std::string(kGroup))},
                                           {"SourcePath", str("Incoming/tree")}, {"DestPath", str("x")}}), 55},
        {"28 identifier with ..", request({{"Command", u64(28)}, {"Identifier", str("../" + std::string(kApp))},
                                           {"CreateIfNecessary", Value::boolean(true)}}), 11},
        {"28 absolute identifier", request({{"Command", u64(28)}, {"Identifier", str(app)},
                                            {"CreateIfNecessary", Value::boolean(true)}}), 11},
        {"29 path with ..", request({{"Command", u64(29)}, {"Identifier", str(kApp)},
                                     {"SourcePath", str("../../Documents")}}), 10},
        {"29 absolute path", request({{"Command", u64(29)}, {"Identifier", str(kApp)},
                                      {"SourcePath", str(victim + "/file")}}), 10},
        {"29 the assets directory itself", request({{"Command", u64(29)}, {"Identifier", str(kApp)},
                                                    {"SourcePath", str(".")}}), 10},
        {"29 empty path", request({{"Command", u64(29)}, {"Identifier", str(kApp)}, {"SourcePath", str("")}}), 10},
        {"29 link to a directory out", request({{"Command", u64(29)}, {"Identifier", str(kApp)},
                                                {"SourcePath", str("escape")}}), 10},
        {"29 link to a file out", request({{"Command", u64(29)}, {"Identifier", str(kApp)},
                                           {"SourcePath", str("escape-file")}}), 10},
        {"29 through a link out", request({{"Command", u64(29)}, {"Identifier", str(kApp)},
                                           {"SourcePath", str("escape/file")}}), 10},
        {"29 link up to /", request({{"Command", u64(29)}, {"Identifier", str(kApp)},
                                     {"SourcePath", str("up" + victim + "/file")}}), 10},
        {"29 identifier with ..", request({{"Command", u64(29)}, {"Identifier", str("../" + std::string(kApp))},
                                           {"SourcePath", str("x")}}), 11},

        // Links planted inside containers before the operations that walk them.
        {"disk usage", request({{"Command", u64(23)}, {"Identifier", str(kApp)}, {"ContainerClass", u64(2)},
                                {"UUID", appUUID}}), 1},
        {"protection change", request({{"Command", u64(21)}, {"Identifier", str(kApp)}, {"ContainerClass", u64(2)},
                                       {"DataProtectionClass", Value::int64(3)}}), 1, true},
        {"skeleton re-creation", request({{"Command", u64(8)}, {"Identifier", str(kApp)}, {"ContainerClass", u64(2)},
                                          {"UUID", appUUID}}), 1},
        {"system container ACL reset", request({{"Command", u64(8)}, {"Identifier", str(kSystem)},
                                                {"ContainerClass", u64(12)}, {"UUID", systemUUID}}), 1, true},
        {"shared-content staging", request({{"Command", u64(26)}, {"Identifier", str(kGroup)},
                                            {"SourcePath", str("Incoming/tree")}, {"DestPath", str("Staged")}}),
         1, true},
        {"wipe", request({{"Command", u64(12)}, {"Identifier", str("com.example.hostile.wiped")},
                          {"ContainerClass", u64(2)}}), 1, true},
        {"delete", request({{"Command", u64(10)}, {"Identifier", str("com.example.hostile.deleted")},
                            {"ContainerClass", u64(2)}}), 1, true},

        // Identifiers that would make a file name climb or overflow.
        {"protection: identifier with /", protect("a/../../b"), 11},
        {"protection: identifier .", protect("."), 11},
        {"protection: identifier ..", protect(".."), 11},
        {"protection: 4 KiB identifier", protect(longName), 11},
        {"protection: identifier too long for the file name", protect(nameTooLong), 11},
        {"protection: empty identifier", protect(""), 11},
        {"create: empty identifier", request({{"Command", u64(0)}, {"Identifier", str("")}, {"ContainerClass", u64(2)},
                                              {"CreateIfNecessary", Value::boolean(true)}}), 11},
        {"NUL inside a string", raw(Wire().dictionary(2).text("Command").uint64(0).text("Identifier")
                                        .string(std::string("com.example\0evil", 16)).frame()), kClosed},

        // Numbers and sizes at and past their bounds.
        {"class 0", request({{"Command", u64(0)}, {"Identifier", str(kApp)}, {"ContainerClass", u64(0)}}), 20},
        {"class 14", request({{"Command", u64(0)}, {"Identifier", str(kApp)}, {"ContainerClass", u64(14)}}), 20},
        {"class 2^64-1", request({{"Command", u64(6)}, {"Identifier", str(kApp)}, {"ContainerClass", u64(~0ull)},
                                  {"Key", str("k")}}), 11},
        {"a million-element array", request({{"Command", u64(3)},
                                             {"ContainerClassesArray", Value::array(Array(1000000, u64(2)))}}), 38},
        {"command 2^64-1", request({{"Command", u64(~0ull)}}), 49},
        {"16 MiB frame", raw(frameOfLength(kIpcMaxFrameLength)), 49},
        {"16 MiB and one byte", raw(frameOfLength(kIpcMaxFrameLength + 1)), kClosed},
        {"nesting at 64 levels", raw(nestedFrame(64)), 49},
        {"nesting at 65 levels", raw(nestedFrame(65)), kClosed},
        {"a frame that is not one", raw(std::string("\x10\0\0\0VSLX\x01\0\0\0\x01\0\0\0\0\0\0\0", 20)), kClosed},
    };

    // Every key of the commands above with a value of the wrong type: a value that is
    // not of its type reads as absent.
    const Dictionary valid = {{"Identifier", str(kApp)},    {"ContainerClass", u64(2)},     {"UUID", appUUID},
                              {"Key", str("k")},             {"DataProtectionClass", Value::int64(3)},
                              {"SourcePath", str("x")},      {"DestPath", str("y")},        {"NewIdentifier", str(kApp)},
                              {"NewContainerClass", u64(2)}, {"NewContainerUUID", appUUID}};
    struct Key {
        uint64_t command;
        const char* key;
        uint64_t code;
        bool rootMayChange = false;
    };
    for (const Key& k : std::initializer_list<Key>{
             {0, "Identifier", 21},        {0, "ContainerClass", 20},     {0, "CreateIfNecessary", 1},
             {2, "NewIdentifier", 18},     {2, "NewContainerClass", 11},  {2, "NewContainerUUID", 11},
             {3, "ContainerClassesArray", 11}, {3, "UUIDsArray", 11},     {3, "IdentifiersArray", 11},
             {3, "PersonaUniqueStringsArray", 1},
             {5, "Key", 38},               {5, "UUID", 11},               {6, "Key", 38},
             {6, "Identifier", 18},        {6, "ContainerClass", 11},     {7, "InfoDictRequested", 1},
             {10, "Identifier", 18},       {10, "ContainerClass", 20},    {13, "Identifier", 1},
             {17, "GroupIdentifier", 55},  {18, "CodeSigningInfo", 1},   {21, "Identifier", 18},
             {21, "DataProtectionClass", 1, true}, {23, "ContainerClass", 11}, {26, "Identifier", 11},
             {26, "SourcePath", 11},       {26, "DestPath", 11},          {28, "Identifier", 11},
             {28, "CreateIfNecessary", 1}, {29, "Identifier", 11},        {29, "SourcePath", 11}}) {
        Dictionary d = valid;
        d["Command"] = u64(k.command);
        const Value* current = d.count(k.key) ? &d[k.key] : nullptr;
        // Any other type than the right one; for the arrays of command 3, one element too.
        Value wrong = current && current->stringValue() ? u64(7) : str("2");
        if (k.command == 3) {
            d["ContainerClassesArray"] = Value::array({u64(2)});
            d["UUIDsArray"] = Value::array({Value::uuid(Uuid::random())});
            d["IdentifiersArray"] = Value::array({str("com.example.absent")});
            d["PersonaUniqueStringsArray"] = Value::array({str("")});
            wrong = Value::array({k.key == std::string("UUIDsArray") || k.key == std::string("ContainerClassesArray")
                                      ? str("2") : u64(2)});
        }
        d[k.key] = wrong;
        cases.push_back(
            {std::to_string(k.command) + " " + k.key + " of a wrong type", request(d), k.code, k.rootMayChange});
    }

    TreeSnapshot before = rootState();
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        EXPECT_EQ(c.code, c.send());
        if (c.code == kClosed) {
            auto r = bystander->sendRequest(dict({{"Command", u64(27)}}), kWait);
            EXPECT_EQ(49u, r.ok() ? client::replyCode(r) : kClosed) << "another client is still served";
        }
        if (!c.rootMayChange) {
            EXPECT_EQ("", describeDifferences(before, rootState())) << "in the system root";
        }
        EXPECT_EQ("", describeDifferences(victimBefore, snapshotTree(victim))) << "outside the system root";
        // What a case queued for destruction is gone before the next one starts.
        if (c.rootMayChange) {
            EXPECT_EQ(1u, send({{"Command", u64(4)}}));
        }
        before = rootState();
    }

    // The kernel's query, cut short at every byte: each gets a failure code, no container.
    client::VSLUpcallQuery query;
    query.codeSignatureID = "com.example.upcall";
    query.uid = 501;
    query.appGroupIDs = {"group.com.example.upcall"};
    query.systemGroupIDs = {kGroup};
    query.personaID = kVSLUpcallNoPersona;
    const std::string whole = *client::packUpcallQuery(query);
    auto upcall = client::VSLUpcallClient::connect(client::VSLUpcallClient::socketPathForSystemRoot(daemon.root()));
    ASSERT_TRUE(upcall);
    for (size_t length = 0; length < whole.size(); ++length) {
        SCOPED_TRACE("upcall cut at " + std::to_string(length));
        UpcallReplyFrame frame;
        std::string error;
        auto status = upcall->getProcessContainers(whole.substr(0, length), &frame, kWait, &error);
        ASSERT_EQ(client::VSLUpcallStatus::Ok, status) << error;
        EXPECT_NE(0, frame.returnCode);
        EXPECT_TRUE(frame.packbuff.empty());
    }
    EXPECT_EQ("", describeDifferences(before, rootState())) << "after the cut upcalls";

    // Deletions finish in the background: once death row is empty, nothing outside went with it.
    EXPECT_EQ(1u, send({{"Command", u64(4)}}));
    EXPECT_EQ(0, daemon.stop());
    EXPECT_EQ("", describeDifferences(victimBefore, snapshotTree(victim))) << "outside the system root, at the end";
}
