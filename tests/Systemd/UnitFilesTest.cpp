// The shipped units pass the service manager's own checks, and name what the daemon
// looks for: the socket names it adopts and the readiness protocol it speaks.
#include <unistd.h>

#include <fstream>
#include <string>

#include <gtest/gtest.h>

#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

namespace vsl::test {
namespace {

const char* const kAnalyze = "/usr/bin/systemd-analyze";
const char* const kUnits[] = {"vesseld.service", "vesseld.socket", "vesseld-upcall.socket"};

std::string packagingFile(const std::string& name) {
    return readFile(std::string(VESSEL_SOURCE_DIR) + "/packaging/" + name);
}

// The units as installed, their ExecStart pointed at this build's daemon so that the
// check of the command finds a program.
std::string stageUnits(const std::string& dir) {
    for (const char* unit : kUnits) {
        std::string text = packagingFile(unit);
        const std::string installed = "/usr/sbin/vesseld";
        for (size_t at = text.find(installed); at != std::string::npos; at = text.find(installed, at + 1))
            text.replace(at, installed.size(), vesseldPath());
        std::ofstream(dir + "/" + unit) << text;
    }
    return dir;
}

TEST(UnitFilesTest, ServiceManagerAcceptsTheUnits) {
    if (::access(kAnalyze, X_OK) != 0) GTEST_SKIP() << kAnalyze << " is missing: the units were not verified";
    const std::string dir = makeTempDir("vessel-units-");
    stageUnits(dir);
    std::string out, err;
    const int status = runProgram({kAnalyze, "verify", "--man=no", dir + "/vesseld.service", dir + "/vesseld.socket",
                                   dir + "/vesseld-upcall.socket"},
                                  &out, &err);
    removeTree(dir);
    EXPECT_EQ(0, status) << out << err;
    EXPECT_EQ("", err) << "warnings count as failures";
}

TEST(UnitFilesTest, UnitsMatchWhatTheDaemonAdopts) {
    const std::string service = packagingFile("vesseld.service");
    EXPECT_NE(std::string::npos, service.find("Type=notify"));
    EXPECT_NE(std::string::npos, service.find("Restart=always"));
    const std::string socket = packagingFile("vesseld.socket");
    EXPECT_NE(std::string::npos, socket.find("ListenStream=/run/vesseld/com.tarrow.vesseld\n"));
    EXPECT_NE(std::string::npos, socket.find("FileDescriptorName=vesseld\n"));
    EXPECT_NE(std::string::npos, socket.find("SocketMode=0666\n"));
    const std::string upcall = packagingFile("vesseld-upcall.socket");
    EXPECT_NE(std::string::npos, upcall.find("ListenStream=/run/vesseld/com.tarrow.vesseld.upcall\n"));
    EXPECT_NE(std::string::npos, upcall.find("FileDescriptorName=upcall\n"));
    EXPECT_NE(std::string::npos, upcall.find("SocketMode=0600\n"));
    EXPECT_NE(std::string::npos, packagingFile("vesseld.tmpfiles").find("d /run/vesseld 0755 root root"));
}

}  // namespace
}  // namespace vsl::test
