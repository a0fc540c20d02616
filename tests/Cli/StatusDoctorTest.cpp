// vesselctl status and doctor on a healthy root, with the daemon running and stopped,
// and on a root broken in every way doctor knows; doctor changes nothing.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <map>

#include "Platform/UniqueFd.h"
#include "Support/Boot.h"
#include "Support/DaemonProcess.h"
#include "Support/Json.h"
#include "Support/RootFiles.h"
#include "Support/TempRoot.h"
#include "Support/TreeSnapshot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

struct JsonRun {
    int exitCode = -1;
    Value json;
    std::string text;
};

JsonRun ctlJson(const DaemonProcess& daemon, const std::vector<std::string>& args) {
    std::vector<std::string> argv = {vesselctlPath(), "--root", daemon.root(), "--json"};
    argv.insert(argv.end(), args.begin(), args.end());
    JsonRun r;
    std::string err;
    r.exitCode = runProgram(argv, &r.text, &err);
    std::string why;
    auto parsed = parseJson(r.text, &why);
    EXPECT_TRUE(parsed) << why << ": " << r.text << err;
    if (parsed) r.json = *parsed;
    return r;
}

int64_t number(const Value& v, const char* key) {
    const Value* n = v.find(key);
    return n && n->int64Value() ? *n->int64Value() : -1;
}

bool isNull(const Value& v, const char* key) {
    const Value* n = v.find(key);
    return n && n->type() == Value::Type::Null;
}

std::string realPath(const std::string& path) {
    char buffer[PATH_MAX];
    return ::realpath(path.c_str(), buffer) ? buffer : path;
}

// How many findings each check reported.
std::map<std::string, int> findingsByCheck(const Value& doctor) {
    std::map<std::string, int> counts;
    const Value* findings = doctor.find("Findings");
    if (!findings || !findings->arrayValue()) return counts;
    for (const auto& f : *findings->arrayValue()) {
        const Value* check = f.find("Check");
        const Value* fix = f.find("Fix");
        EXPECT_TRUE(fix && fix->stringValue() && !fix->stringValue()->empty()) << "every finding has its fix";
        if (check && check->stringValue()) counts[*check->stringValue()]++;
    }
    return counts;
}

}  // namespace

TEST(VesselctlStatus, HealthyRootWithTheDaemonRunningThenStopped) {
    DaemonProcess daemon;
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    ASSERT_EQ(0, ctlJson(daemon, {"create", "com.example.app"}).exitCode);
    ASSERT_EQ(0, ctlJson(daemon, {"create", "com.example.service", "--class", "system"}).exitCode);

    JsonRun status = ctlJson(daemon, {"status"});
    EXPECT_EQ(0, status.exitCode) << status.text;
    EXPECT_EQ(true, status.json.find("Answering")->boolValue());
    EXPECT_EQ(daemon.pid(), number(status.json, "Pid")) << status.text;
    EXPECT_EQ(realPath(daemon.root()), *status.json.find("Root")->stringValue());
    EXPECT_EQ(daemon.socketPath(), *status.json.find("Socket")->stringValue());
    EXPECT_EQ("unlocked", *status.json.find("LockState")->stringValue());
    const Value* perClass = status.json.find("ContainersPerClass");
    ASSERT_TRUE(perClass && perClass->dictionaryValue()) << status.text;
    EXPECT_EQ(1, number(*perClass, "appData"));
    EXPECT_EQ(1, number(*perClass, "systemData"));
    EXPECT_EQ(0, number(*perClass, "appGroup"));
    EXPECT_EQ(13u, perClass->dictionaryValue()->size());
    // The daemon's own first-boot marker, once its first-boot clean-up has run.
    ASSERT_TRUE(waitForNotification(daemon, "com.tarrow.vesseld.reboot-cleanup-complete", std::chrono::seconds(60)));
    EXPECT_EQ(true, ctlJson(daemon, {"status"}).json.find("FirstBootDone")->boolValue());

    ASSERT_EQ(0, ctlJson(daemon, {"keybag", "lock"}).exitCode);
    EXPECT_EQ("locked", *ctlJson(daemon, {"status"}).json.find("LockState")->stringValue());
    ASSERT_EQ(0, ctlJson(daemon, {"keybag", "unlock"}).exitCode);

    JsonRun doctor = ctlJson(daemon, {"doctor"});
    EXPECT_EQ(0, doctor.exitCode) << doctor.text;
    EXPECT_EQ(true, doctor.json.find("Healthy")->boolValue()) << doctor.text;
    EXPECT_TRUE(findingsByCheck(doctor.json).empty()) << doctor.text;

    // Stopped, with leftovers for the next start to take up.
    ASSERT_EQ(0, daemon.stop());
    writeRootFile(daemon, "private/var/root/Library/Caches/com.tarrow.vesseld/Dead/item-1", "x");
    writeRootFile(daemon, "private/var/root/Library/Caches/com.tarrow.vesseld/Dead/item-2", "x");
    writeRootFile(daemon, "private/var/root/Library/Vesselry/Replace/journal", "x");
    writeRootFile(daemon, "private/var/root/Library/Vesselry/PendingUpdates/com.example.app-2-501.plist", "x");
    status = ctlJson(daemon, {"status"});
    EXPECT_EQ(3, status.exitCode) << "a daemon that does not answer is not a healthy status";
    EXPECT_EQ(false, status.json.find("Answering")->boolValue());
    EXPECT_TRUE(isNull(status.json, "Pid")) << status.text;
    EXPECT_TRUE(isNull(status.json, "ContainersPerClass")) << status.text;
    EXPECT_EQ(2, number(status.json, "DeathRowItems")) << status.text;
    EXPECT_EQ(1, number(status.json, "ReplaceJournals")) << status.text;
    EXPECT_EQ(1, number(status.json, "PendingProtectionChanges")) << status.text;

    doctor = ctlJson(daemon, {"doctor"});
    EXPECT_EQ(0, doctor.exitCode) << "a stopped daemon leaves nothing wrong behind: " << doctor.text;
}

TEST(VesselctlDoctor, NamesEveryProblemOfABrokenRootAndChangesNothing) {
    DaemonProcess daemon;
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    ASSERT_EQ(0, daemon.stop());

    writeRootFile(daemon, "etc/passwd", "root:x:0:0::/private/var/root:/bin/sh\n");
    writeRootFile(daemon, "etc/group", "wheel:x:0:\n");
    writeRootFile(daemon, "etc/vesseld/device.plist", "not a property list");
    writeRootFile(daemon, "etc/vesseld/personas.plist",
                  "<plist version=\"1.0\"><array><string>no persona</string></array></plist>\n");
    ASSERT_EQ(0, ::unlink(daemon.at("etc/vesseld/code-signatures/vesselctl.plist").c_str()));
    writeRootFile(daemon, "etc/vesseld/code-signatures/broken.plist", "<plist><dict><key>");
    writeRootFile(daemon, "etc/vesseld/code-signatures/ghost.plist",
                  "<plist version=\"1.0\"><dict><key>Executable</key><string>/nonexistent/ghost</string>"
                  "<key>SigningIdentifier</key><string>com.example.ghost</string></dict></plist>\n");
    ASSERT_EQ(0, ::chmod(daemon.at("etc/vesseld/code-signatures/ghost.plist").c_str(), 0666));
    {
        // A socket file left by a daemon that died: bound once, listened on no more.
        UniqueFd s(::socket(AF_UNIX, SOCK_STREAM, 0));
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strncpy(address.sun_path, daemon.socketPath().c_str(), sizeof(address.sun_path) - 1);
        ASSERT_EQ(0, ::bind(s.get(), reinterpret_cast<sockaddr*>(&address), sizeof(address))) << std::strerror(errno);
    }

    const TreeSnapshot before = snapshotTree(daemon.root());
    JsonRun doctor = ctlJson(daemon, {"doctor"});
    std::string human, err;
    const int humanExit = runProgram({vesselctlPath(), "--root", daemon.root(), "doctor"}, &human, &err);
    JsonRun status = ctlJson(daemon, {"status"});
    EXPECT_EQ(before, snapshotTree(daemon.root())) << "doctor and status changed the root";

    EXPECT_EQ(1, doctor.exitCode) << doctor.text;
    EXPECT_EQ(1, humanExit) << human << err;
    EXPECT_EQ(false, doctor.json.find("Healthy")->boolValue());
    auto counts = findingsByCheck(doctor.json);
    EXPECT_EQ(2, counts["users"]) << "mobile and systemusers: " << doctor.text;
    EXPECT_EQ(1, counts["device.plist"]) << doctor.text;
    EXPECT_EQ(1, counts["personas.plist"]) << doctor.text;
    EXPECT_EQ(3, counts["policy store"]) << "unparsable, group-writable, missing executable: " << doctor.text;
    EXPECT_EQ(1, counts["entitlement"]) << doctor.text;
    EXPECT_EQ(1, counts["socket"]) << doctor.text;
    for (const char* named : {"mobile", "systemusers", "63", "broken.plist", "/nonexistent/ghost", "chmod go-w",
                              "no daemon listens", "com.tarrow.private.Vesselry.allowed"})
        EXPECT_NE(std::string::npos, human.find(named)) << named << " in:\n" << human;

    EXPECT_EQ(3, status.exitCode) << status.text;
    EXPECT_EQ(false, status.json.find("Answering")->boolValue()) << status.text;
}
