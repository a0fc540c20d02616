#include "Keybag.h"

#include <cstdio>
#include <cstring>

#include "Platform/Keybag.h"
#include "Platform/SystemRoot.h"

using namespace vsl;

int runKeybagCommand(const std::string& root, int argc, char** argv, bool asJson) {
    std::string verb = argc > 1 ? argv[1] : "";
    if (argc != 2 || (verb != "lock" && verb != "unlock" && verb != "state")) {
        std::fprintf(stderr, "usage: vesselctl keybag lock|unlock|state\n");
        return 2;
    }
    setSystemRoot(root);
    if (verb != "state") {
        if (int rc = setKeybagLockState(verb == "lock")) {
            std::fprintf(stderr, "vesselctl: cannot write %s: %s\n", keybagLockStatePath().c_str(), std::strerror(rc));
            return 1;
        }
    }
    int state = keybagLockState();
    const char* name = state == kKeybagLocked ? "locked" : state == kKeybagUnlocked ? "unlocked" : "transition";
    if (asJson)
        std::printf("{\"LockState\": %d, \"State\": \"%s\"}\n", state, name);
    else
        std::printf("%s\n", name);
    return 0;
}
