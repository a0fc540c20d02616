#include "Support/RootFiles.h"

#include <dirent.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <fstream>

namespace vsl::test {

void writeRootFile(const DaemonProcess& daemon, const std::string& relative, const std::string& bytes) {
    std::string path = daemon.at(relative);
    std::string mk = "mkdir -p '" + path.substr(0, path.rfind('/')) + "'";
    ASSERT_EQ(0, std::system(mk.c_str()));
    std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
}

std::vector<std::string> entriesOf(const std::string& directory) {
    std::vector<std::string> names;
    DIR* dir = ::opendir(directory.c_str());
    if (!dir) return names;
    while (dirent* e = ::readdir(dir)) {
        std::string name = e->d_name;
        if (name != "." && name != "..") names.push_back(name);
    }
    ::closedir(dir);
    std::sort(names.begin(), names.end());
    return names;
}

}  // namespace vsl::test
