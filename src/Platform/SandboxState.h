// The kernel sandbox's per-user container items: for each uid, which path an
// identifier's container of a given item type and persona lives at. Kept in one
// file per uid under run/vesseld/sandbox/ of the system root, so the items outlive a
// daemon restart like kernel memory does; a boot clears them (run/ is not kept
// across boots, a table written under another boot id is ignored, and the first
// start after a simulated reboot calls clearForBoot()).
//
// A table is an append-only log of checksummed records replayed into memory: a set
// is one appended record, and a record torn by a crash is dropped on the next read.
// The process keeps each table in memory and re-reads it when its file changed.
// Paths below the system root are stored relative to it, so a root that was copied
// or moved answers with its own paths. Functions return 0 or an errno value; any
// thread may call them.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace vsl {

struct SandboxContainerItem {
    uint64_t type = 0;
    int32_t personaID = 0;
    std::string identifier;
    std::string path;
};

// One set: with a path the item is (re)placed, without one it is removed. Items are
// keyed by type, persona ID and identifier.
struct SandboxContainerItemChange {
    uint64_t type = 0;
    int32_t personaID = 0;
    std::string identifier;
    std::optional<std::string> path;
};

class SandboxState {
public:
    static int setItem(uid_t uid, const SandboxContainerItemChange& change);
    // Applies the changes in order as one write; changes that leave an item as it is
    // write nothing.
    static int setItems(uid_t uid, const std::vector<SandboxContainerItemChange>& changes);
    // Calls back once per item of `uid`, outside any lock, in no particular order.
    static int iterateItems(uid_t uid, const std::function<void(const SandboxContainerItem&)>& callback);

    // Forgets every uid's items: what a boot does to kernel memory.
    static int clearForBoot();

    // Removes the temporary files of table rewrites that a kill cut short. For the
    // start, before anything writes a table.
    static int removeTemporaryFiles();

    static std::string directory();  // run/vesseld/sandbox below the system root
};

}  // namespace vsl
