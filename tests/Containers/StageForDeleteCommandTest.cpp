// End to end: command 3 (stageContainerForDelete) decoding a batch of containers,
// sent as typed requests by this test program, which the policy store entitles.
#include <gtest/gtest.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <fstream>

#include "Client/VSLConnection.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Platform/PropertyList.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

const char* const kAllowed = "com.tarrow.private.Vesselry.allowed";

void writeRootFile(const DaemonProcess& daemon, const std::string& relative, const std::string& bytes) {
    std::string path = daemon.at(relative);
    std::string mk = "mkdir -p '" + path.substr(0, path.rfind('/')) + "'";
    ASSERT_EQ(0, std::system(mk.c_str()));
    std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
}

// This test program itself, entitled: vesselctl cannot send a malformed UUID.
void registerSelf(DaemonProcess& daemon) {
    ASSERT_TRUE(daemon.registerProgram("/proc/self/exe", "stager", "com.example.stager",
                                       dict({{kAllowed, Value::boolean(true)}})));
}

struct Made {
    Value uuid;
    std::string path;
};

Made create(const DaemonProcess& daemon, const std::string& admin, const std::string& identifier) {
    auto r =
        daemon.run(admin, {"createOrLookup", "Identifier=" + identifier, "ContainerClass=2", "CreateIfNecessary=true"});
    EXPECT_EQ(1u, r.code()) << r.err;
    Made m;
    if (const Value* v = r.reply.find("ReplyUUID"); v && v->dataValue())
        if (auto u = Uuid::fromBytes(v->dataValue()->data(), v->dataValue()->size())) m.uuid = Value::uuid(*u);
    if (const Value* p = r.reply.find("ReplyPath"); p && p->stringValue()) m.path = *p->stringValue();
    return m;
}

bool found(const DaemonProcess& daemon, const std::string& admin, const std::string& identifier) {
    auto r = daemon.run(admin, {"createOrLookup", "Identifier=" + identifier, "ContainerClass=2"});
    EXPECT_TRUE(r.code() == 1 || r.code() == 21) << r.code() << " " << r.err;
    return r.code() == 1;
}

bool exists(const std::string& path) { return !path.empty() && ::access(path.c_str(), F_OK) == 0; }

Value strings(std::initializer_list<const char*> items) {
    Array a;
    for (const char* s : items) a.push_back(Value::string(s));
    return Value::array(std::move(a));
}

Value classes(size_t count) { return Value::array(Array(count, Value::uint64(2))); }

uint64_t stage(const DaemonProcess& daemon, Dictionary request) {
    request["Command"] = Value::uint64(3);
    std::string error;
    auto c = client::VSLConnection::connect(daemon.socketPath(), &error);
    EXPECT_TRUE(c) << error;
    if (!c) return 0;
    auto r = c->sendRequest(Value::dictionary(std::move(request)), std::chrono::seconds(30));
    EXPECT_TRUE(r.ok()) << r.error;
    const Value* code = r.ok() ? r.body.find("ReplyError") : nullptr;
    return code && code->uint64Value() ? *code->uint64Value() : 0;
}

std::string logText(const DaemonProcess& daemon) {
    return readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log"));
}

}  // namespace

TEST(StageForDeleteCommand, UnequalArraysStageNothingAndOneMalformedUUIDSkipsOnlyItself) {
    DaemonProcess daemon;
    std::string admin = daemon.addClient("admin", "com.example.admin", dict({{kAllowed, Value::boolean(true)}}));
    registerSelf(daemon);
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    Made one = create(daemon, admin, "com.example.one");
    Made two = create(daemon, admin, "com.example.two");
    Made three = create(daemon, admin, "com.example.three");
    ASSERT_TRUE(one.uuid.uuidValue() && two.uuid.uuidValue() && three.uuid.uuidValue());

    // One identifier short, and a missing array (length 0): 38, nothing moves.
    EXPECT_EQ(38u, stage(daemon, {{"ContainerClassesArray", classes(3)},
                                  {"UUIDsArray", Value::array({one.uuid, two.uuid, three.uuid})},
                                  {"IdentifiersArray", strings({"com.example.one", "com.example.two"})},
                                  {"PersonaUniqueStringsArray", strings({"", "", ""})}}));
    EXPECT_EQ(38u, stage(daemon, {{"ContainerClassesArray", classes(1)},
                                  {"UUIDsArray", Value::array({one.uuid})},
                                  {"IdentifiersArray", strings({"com.example.one"})}}));
    EXPECT_NE(std::string::npos,
              logText(daemon).find("stageContainerForDelete: Can't act on an invalid input: UUIDString count: 3, "
                                   "class count: 3, ID count: 2, persona string count: 3"))
        << logText(daemon);
    for (const auto& [identifier, made] :
         {std::pair{"com.example.one", &one}, {"com.example.two", &two}, {"com.example.three", &three}}) {
        EXPECT_TRUE(found(daemon, admin, identifier)) << identifier;
        EXPECT_TRUE(exists(made->path)) << identifier;
    }

    // The middle UUID is not a UUID: the others are staged, the answer is 11.
    EXPECT_EQ(11u,
              stage(daemon, {{"ContainerClassesArray", classes(3)},
                             {"UUIDsArray", Value::array({one.uuid, Value::string("not-a-uuid"), three.uuid})},
                             {"IdentifiersArray", strings({"com.example.one", "com.example.two", "com.example.three"})},
                             {"PersonaUniqueStringsArray", strings({"", "", ""})}}));
    EXPECT_FALSE(found(daemon, admin, "com.example.one"));
    EXPECT_FALSE(exists(one.path));
    EXPECT_TRUE(found(daemon, admin, "com.example.two"));
    EXPECT_TRUE(exists(two.path));
    EXPECT_FALSE(found(daemon, admin, "com.example.three"));
    EXPECT_FALSE(exists(three.path));

    // Errors made inside helper lambdas above (lookups of what is gone) still name
    // the method that wrote them.
    EXPECT_EQ(std::string::npos, logText(daemon).find("operator()")) << logText(daemon);
    EXPECT_EQ(0, daemon.stop());
}

TEST(StageForDeleteCommand, AnUnknownPersonaStagesNothing) {
    DaemonProcess daemon;
    // The mobile user (the invoking one when not root) has one personal persona.
    uint64_t uid = ::geteuid() == 0 ? 501 : ::geteuid();
    uint64_t gid = ::geteuid() == 0 ? 501 : ::getegid();
    auto personas = encodeBinaryPropertyList(Value::array({dict({{"PersonaType", Value::uint64(0)},
                                                                 {"KernelPersonaID", Value::uint64(1000)},
                                                                 {"UID", Value::uint64(uid)},
                                                                 {"GID", Value::uint64(gid)},
                                                                 {"PersonaUniqueString", Value::string("P")},
                                                                 {"BundleIdentifiers", Value::array({})}})}),
                                             nullptr);
    ASSERT_TRUE(personas);
    writeRootFile(daemon, "etc/vesseld/personas.plist", *personas);
    writeRootFile(daemon, "etc/vesseld/device.plist",
                  *encodeBinaryPropertyList(dict({{"PersonasSupported", Value::boolean(true)}}), nullptr));
    std::string admin = daemon.addClient("admin", "com.example.admin", dict({{kAllowed, Value::boolean(true)}}));
    registerSelf(daemon);
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    Made one = create(daemon, admin, "com.example.one");
    Made two = create(daemon, admin, "com.example.two");

    Dictionary batch{{"ContainerClassesArray", classes(2)},
                     {"UUIDsArray", Value::array({one.uuid, two.uuid})},
                     {"IdentifiersArray", strings({"com.example.one", "com.example.two"})},
                     {"PersonaUniqueStringsArray", strings({"P", "no-such-persona"})}};
    EXPECT_EQ(76u, stage(daemon, batch));
    EXPECT_TRUE(found(daemon, admin, "com.example.one")) << "the element before it is not staged either";
    EXPECT_TRUE(exists(one.path));
    EXPECT_TRUE(found(daemon, admin, "com.example.two"));

    // Named by a persona that exists, both go.
    batch["PersonaUniqueStringsArray"] = strings({"P", "P"});
    EXPECT_EQ(1u, stage(daemon, batch));
    EXPECT_FALSE(found(daemon, admin, "com.example.one"));
    EXPECT_FALSE(exists(one.path));
    EXPECT_FALSE(found(daemon, admin, "com.example.two"));
    EXPECT_EQ(0, daemon.stop());
}
