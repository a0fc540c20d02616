// vesselctl keybag lock|unlock|state: the device lock state of a system root, without
// the daemon (it learns of a change through the lock-status notification).

#include <cstdio>
#include <cstring>

#include "Platform/Keybag.h"
#include "Platform/SystemRoot.h"
#include "SubcommandTable.h"

using namespace vsl;

int runKeybag(const CtlOptions& options, const SubcommandArgs& args) {
    std::string verb = args.words.size() == 1 ? args.words[0] : "";
    if (verb != "lock" && verb != "unlock" && verb != "state") return printUsageError(options, "keybag lock|unlock|state");
    setSystemRoot(options.root);
    if (verb != "state") {
        if (int rc = setKeybagLockState(verb == "lock"))
            return printFailure(options, kExitFailed, 0, "WriteFailed",
                                "cannot write " + keybagLockStatePath() + ": " + std::strerror(rc));
    }
    int state = keybagLockState();
    const char* name = state == kKeybagLocked ? "locked" : state == kKeybagUnlocked ? "unlocked" : "transition";
    if (options.json)
        std::printf("{\"LockState\":%d,\"State\":\"%s\"}\n", state, name);
    else
        std::printf("%s\n", name);
    return 0;
}
