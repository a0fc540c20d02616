// vesselctl keybag lock|unlock|state: the device lock state of a system root, without
// the daemon (it learns of a change through the lock-status notification).
#pragma once

#include <string>

// argv[0] is "keybag". Returns the exit status.
int runKeybagCommand(const std::string& root, int argc, char** argv, bool asJson);
