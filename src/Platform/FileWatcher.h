// The process's one inotify instance and its one thread. Everything the daemon
// watches (the persona list, the policy store, notifications, the keybag state) is a
// file in a directory: a watch names the directory and, optionally, one entry in it.
#pragma once

#include <cstdint>
#include <functional>
#include <string>

namespace vsl {

class FileWatcher {
public:
    using Callback = std::function<void()>;

    static FileWatcher& shared();  // never destroyed

    // `changed` runs on the watcher thread after the entry `name` of `directory` (any
    // entry when `name` is empty) is written, created, moved or removed, after the
    // directory itself appears, goes away or is replaced, and when the kernel lost
    // events. A missing directory is waited for through its parent. Callbacks must be
    // short: they share one thread. Returns a token for `unwatch`, or 0 with errno
    // when neither the directory nor its parent can be watched.
    uint64_t watch(const std::string& directory, const std::string& name, Callback changed);

    // After it returns the callback is neither running (unless this is the watcher
    // thread, inside it) nor called again.
    void unwatch(uint64_t token);

    // Returns once the events the kernel had queued when it was called have been
    // handled (at most about a second), so a change made before a call is seen by the
    // callbacks when it returns.
    void sync();

private:
    FileWatcher();
    struct State;
    State* state_;
};

}  // namespace vsl
