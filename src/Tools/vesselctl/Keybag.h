// vesselctl keybag lock|unlock|state: the device lock state of a system root, without
// the daemon (it learns of a change through the lock-status notification).
// runKeybag, SubcommandTable.h.
#pragma once
