// A scratch system root for tests: a temporary directory with the files a daemon
// expects (a "mobile" user, device facts), selected as the process's system root.
#pragma once

#include <sys/types.h>

#include <string>

#include "Platform/Value.h"

namespace vsl::test {

class TempRoot {
public:
    // mobileUID/GID default to 501 so identities are valid whoever runs the test.
    explicit TempRoot(uid_t mobileUID = 501, gid_t mobileGID = 501);
    ~TempRoot();
    TempRoot(const TempRoot&) = delete;
    TempRoot& operator=(const TempRoot&) = delete;

    const std::string& path() const { return path_; }
    std::string at(const std::string& relative) const;  // host path below the root

    void writeFile(const std::string& relative, const std::string& contents) const;
    void writeDeviceFacts(const Value& dictionary) const;  // then reloads them

private:
    std::string path_;
    pid_t owner_;
};

std::string readFile(const std::string& path);
// A new directory inside this test process's scratch directory, which goes when the
// process that made it exits (see TempRoot.cpp); removeTree may take it earlier.
std::string makeTempDir(const std::string& prefix);
void removeTree(const std::string& path);

}  // namespace vsl::test
