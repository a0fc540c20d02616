// Feeds arbitrary bytes to the code-signing policy store as a file of its directory, the
// way the daemon loads it. The same bytes lie in two files; checks: every record loaded is
// well formed, names one executable once, and comes from the file that sorts first.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <set>
#include <string>

#include "Platform/CodeSigningPolicy.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"

using namespace vsl;

namespace {

#define REQUIRE(cond) ((cond) ? (void)0 : __builtin_trap())

struct Store {
    std::string directory;
    std::string first, second;
    CodeSigningPolicy* policy = nullptr;
};

void writeAll(const std::string& path, const uint8_t* data, size_t size) {
    const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    REQUIRE(fd >= 0);
    for (size_t done = 0; done < size;) {
        const ssize_t n = ::write(fd, data + done, size - done);
        REQUIRE(n > 0);
        done += static_cast<size_t>(n);
    }
    ::close(fd);
}

Store& store() {
    static Store s = [] {
        const char* tmp = std::getenv("TMPDIR");
        std::string templ = std::string(tmp && *tmp ? tmp : "/tmp") + "/vessel-policy-fuzz-XXXXXX";
        if (!::mkdtemp(templ.data())) std::abort();
        static const std::string removeAtExit = templ;
        std::atexit([] {
            std::error_code ignored;
            std::filesystem::remove_all(removeAtExit, ignored);
        });
        ::chmod(templ.c_str(), 0755);
        Store made;
        made.directory = templ;
        made.first = joinPath(templ, "a.plist");
        made.second = joinPath(templ, "b.plist");
        // Never destroyed: the file watcher may still call into it at exit.
        made.policy = new CodeSigningPolicy(templ);
        return made;
    }();
    return s;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    ::setenv("VESSELD_OSLOG", "off", 1);
    store();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    Store& s = store();
    writeAll(s.first, data, size);
    writeAll(s.second, data, size);
    s.policy->reload();
    std::set<std::string> executables;
    for (const CodeSigningRecord& r : s.policy->records()) {
        REQUIRE(!r.signingIdentifier.empty());
        REQUIRE(r.executable.starts_with('/'));
        REQUIRE(r.sourceFile == s.first);
        REQUIRE(executables.insert(r.executable).second);
        auto found = s.policy->recordForExecutable(r.executable);
        REQUIRE(found && found->signingIdentifier == r.signingIdentifier && found->sandboxed == r.sandboxed);
        // Compared as bytes: a NaN among the entitlements is equal to nothing, itself included.
        REQUIRE(encodeBinaryPropertyList(Value::dictionary(found->entitlements), nullptr) ==
                encodeBinaryPropertyList(Value::dictionary(r.entitlements), nullptr));
    }
    return 0;
}
