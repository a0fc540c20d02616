#include "Wait.h"

#include <cstdio>
#include <cstdlib>

#include "Client/VSLNotification.h"

namespace {

// NAME [--timeout SECONDS], in either order; false on anything else.
bool parseWaitArguments(int argc, char** argv, std::string* name, long* timeoutSeconds) {
    for (int i = 1; i < argc; i++) {
        std::string a = argv[i];
        if (a == "--timeout" && i + 1 < argc) {
            char* end = nullptr;
            *timeoutSeconds = std::strtol(argv[++i], &end, 10);
            if (*end || *timeoutSeconds < 0) return false;
        } else if (name->empty() && !a.empty() && a[0] != '-') {
            *name = a;
        } else {
            return false;
        }
    }
    return !name->empty();
}

}  // namespace

int runWaitCommand(const std::string& root, long defaultTimeoutSeconds, int argc, char** argv) {
    std::string name;
    long timeoutSeconds = defaultTimeoutSeconds;
    if (!parseWaitArguments(argc, argv, &name, &timeoutSeconds)) {
        std::fprintf(stderr, "usage: vesselctl wait NAME [--timeout SECONDS]\n");
        return 2;
    }
    if (vsl::client::waitForNotification(root, name, std::chrono::seconds(timeoutSeconds))) return 0;
    std::fprintf(stderr, "vesselctl: %s was not posted within %ld s\n", name.c_str(), timeoutSeconds);
    return 1;
}
