#include "Support/TempRoot.h"

#include <ftw.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <iterator>
#include <stdexcept>

#include "Platform/DeviceFacts.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"

namespace vsl::test {

std::string makeTempDir(const std::string& prefix) {
    std::string templ = (std::getenv("TMPDIR") ? std::string(std::getenv("TMPDIR")) : std::string("/tmp")) +
                        "/" + prefix + "XXXXXX";
    if (!mkdtemp(templ.data())) throw std::runtime_error("mkdtemp failed");
    return templ;
}

void removeTree(const std::string& path) {
    nftw(
        path.c_str(),
        [](const char* p, const struct stat*, int, struct FTW*) { return ::remove(p) == 0 ? 0 : 0; }, 64,
        FTW_DEPTH | FTW_PHYS);
}

std::string readFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

TempRoot::TempRoot(uid_t mobileUID, gid_t mobileGID) : path_(makeTempDir("vessel-root-")) {
    std::string home = "/private/var/mobile";
    writeFile("etc/passwd", "root:x:0:0:root:/private/var/root:/bin/sh\nmobile:x:" + std::to_string(mobileUID) +
                                ":" + std::to_string(mobileGID) + "::" + home + ":/bin/sh\n");
    writeFile("etc/group", "wheel:x:0:\nmobile:x:" + std::to_string(mobileGID) + ":\n");
    writeFile("private/var/mobile/.keep", "");
    setSystemRoot(path_);
    reloadDeviceFacts();
}

TempRoot::~TempRoot() {
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
