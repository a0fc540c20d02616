#include "Support/TempRoot.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <iterator>
#include <stdexcept>

#include "Platform/DeviceFacts.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Platform/TreeRemove.h"

namespace vsl::test {

namespace {

const char* const kScratchVariable = "VESSEL_TEST_SCRATCH";

// Every temporary directory a test process makes lies in one scratch directory of that
// process, which the process that made it removes when it exits. Its children (death
// tests, which may die without running any destructor, and daemons) inherit it and
// make theirs inside, so nothing they leave outlives the test either.
class Scratch {
public:
    Scratch() {
        if (const char* inherited = std::getenv(kScratchVariable); inherited && *inherited) {
            path_ = inherited;
            return;
        }
        const char* tmp = std::getenv("TMPDIR");
        std::string templ = std::string(tmp && *tmp ? tmp : "/tmp") + "/vessel-test-XXXXXX";
        if (!mkdtemp(templ.data())) throw std::runtime_error("mkdtemp failed");
        // Tests that act as other users reach their roots through it.
        ::chmod(templ.c_str(), 0755);
        path_ = templ;
        owner_ = ::getpid();
        ::setenv(kScratchVariable, path_.c_str(), 1);
    }
    ~Scratch() {
        // A forked child that exits normally runs this too; only the maker removes.
        if (owner_ == ::getpid()) removeTree(path_);
    }
    const std::string& path() const { return path_; }

private:
    std::string path_;
    pid_t owner_ = 0;
};

// Made before main, so a forked death-test child never makes one of its own.
const Scratch& scratch() {
    static Scratch s;
    return s;
}
[[maybe_unused]] const Scratch& madeAtStart = scratch();

}  // namespace

std::string makeTempDir(const std::string& prefix) {
    std::string templ = scratch().path() + "/" + prefix + "XXXXXX";
    if (!mkdtemp(templ.data())) throw std::runtime_error("mkdtemp failed");
    return templ;
}

void removeTree(const std::string& path) {
    // Descriptor-relative, so trees deeper than PATH_MAX go too.
    vsl::removeTree(path, [](const RemoveFailure&) {});
}

std::string readFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

TempRoot::TempRoot(uid_t mobileUID, gid_t mobileGID) : path_(makeTempDir("vessel-root-")), owner_(::getpid()) {
    std::string home = "/private/var/mobile";
    writeFile("etc/passwd", "root:x:0:0:root:/private/var/root:/bin/sh\nmobile:x:" + std::to_string(mobileUID) +
                                ":" + std::to_string(mobileGID) + "::" + home + ":/bin/sh\n");
    writeFile("etc/group", "wheel:x:0:\nmobile:x:" + std::to_string(mobileGID) + ":\n");
    writeFile("private/var/mobile/.keep", "");
    setSystemRoot(path_);
    reloadDeviceFacts();
}

TempRoot::~TempRoot() {
    // A forked child that exits normally must not take its parent's root away.
    if (owner_ != ::getpid()) return;
    removeTree(path_);
    setSystemRoot("/");
    reloadDeviceFacts();
}

std::string TempRoot::at(const std::string& relative) const { return joinPath(path_, relative); }

void TempRoot::writeFile(const std::string& relative, const std::string& contents) const {
    std::string full = at(relative);
    // mkdir -p of the parents
    for (size_t i = path_.size() + 1; i < full.size(); i++)
        if (full[i] == '/') ::mkdir(full.substr(0, i).c_str(), 0755);
    std::ofstream out(full, std::ios::binary | std::ios::trunc);
    out << contents;
}

void TempRoot::writeDeviceFacts(const Value& dictionary) const {
    auto bytes = encodeBinaryPropertyList(dictionary, nullptr);
    writeFile("etc/vesseld/device.plist", bytes ? *bytes : std::string());
    reloadDeviceFacts();
}

}  // namespace vsl::test
