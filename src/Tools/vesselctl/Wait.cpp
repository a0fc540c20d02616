#include "Wait.h"

#include <chrono>
#include <cstdio>
#include <cstdlib>

#include "Client/VSLNotification.h"

namespace {

constexpr const char* kWaitSynopsis = "wait NAME [--timeout SECONDS]";

// NAME [--timeout SECONDS], in either order; false on anything else.
bool parseWaitArguments(const std::vector<std::string>& words, std::string* name, long* timeoutSeconds) {
    for (size_t i = 0; i < words.size(); i++) {
        const std::string& a = words[i];
        if (a == "--timeout" && i + 1 < words.size()) {
            char* end = nullptr;
            *timeoutSeconds = std::strtol(words[++i].c_str(), &end, 10);
            if (*end || words[i].empty() || *timeoutSeconds < 0) return false;
        } else if (name->empty() && !a.empty() && a[0] != '-') {
            *name = a;
        } else {
            return false;
        }
    }
    return !name->empty();
}

}  // namespace

int runWait(const CtlOptions& options, const SubcommandArgs& args) {
    std::string name;
    long timeoutSeconds = options.timeoutSeconds;
    if (!parseWaitArguments(args.words, &name, &timeoutSeconds)) return printUsageError(options, kWaitSynopsis);
    if (!vsl::client::waitForNotification(options.root, name, std::chrono::seconds(timeoutSeconds)))
        return printFailure(options, kExitFailed, 0, "NotPosted",
                            name + " was not posted within " + std::to_string(timeoutSeconds) + " s");
    if (options.json)
        std::printf("{\"Name\":%s,\"Posted\":true}\n", jsonString(name).c_str());
    else
        std::printf("%s posted\n", name.c_str());
    return kExitSuccess;
}
