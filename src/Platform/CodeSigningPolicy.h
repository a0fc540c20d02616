// The trusted code-signing policy store: which executables carry which signing
// identifier, entitlements and sandbox state. It stands in for the platform's
// code-signing service; nothing a client sends is ever consulted.
//
// The store is a directory of property lists (etc/vesseld/code-signatures/*.plist
// under the system root), each holding one record dictionary or an array of them:
//   "Executable"        absolute host path (resolved to its real path when loaded)
//   "SigningIdentifier" non-empty string
//   "Entitlements"      dictionary (absent: empty)
//   "Sandboxed"         bool (absent: false)
// Files must belong to root or to the daemon's own user and must not be writable
// by group or others; other files, and malformed records, are skipped with a log
// line. When two records name one executable, the file that sorts first wins.
// The store is re-read when a file in the directory changes (inotify, checked
// without blocking on each lookup).
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Platform/AuditToken.h"
#include "Platform/Value.h"

namespace vsl {

class IpcPeer;

struct CodeSigningRecord {
    std::string executable;  // real host path
    std::string signingIdentifier;
    Dictionary entitlements;
    bool sandboxed = false;
    std::string sourceFile;  // the policy file it came from
};

// What the store says about one process. An executable without a record has no
// signing identifier, no entitlements and is not sandboxed.
struct CodeSigningInfo {
    std::optional<std::string> signingIdentifier;
    Dictionary entitlements;
    bool sandboxed = false;
    std::string executable;  // real path; empty when it could not be read
    std::string error;       // why there is no signing identifier
};

// The well-formed records of one policy file's contents, in file order; what is skipped
// is logged. `file` only names the source.
std::vector<CodeSigningRecord> parsePolicyFile(const std::string& bytes, const std::string& file);

class CodeSigningPolicy {
public:
    // directory is a host path; it need not exist yet.
    explicit CodeSigningPolicy(std::string directory);
    ~CodeSigningPolicy();
    CodeSigningPolicy(const CodeSigningPolicy&) = delete;
    CodeSigningPolicy& operator=(const CodeSigningPolicy&) = delete;

    // The store under the current system root, made on first use.
    static CodeSigningPolicy& shared();
    static std::string defaultDirectory();  // rootedPath("etc/vesseld/code-signatures")

    // The peer's executable as it was when the peer connected; a process that
    // exec'd since cannot lend the new image's rights to the old connection.
    CodeSigningInfo infoForPeer(const IpcPeer& peer);
    // For a process known only by its token: its executable is read now and the
    // token's start time verified afterwards.
    CodeSigningInfo infoForAuditToken(const AuditToken& token);
    CodeSigningInfo infoForExecutable(const std::string& realPath);

    std::optional<CodeSigningRecord> recordForExecutable(const std::string& realPath);
    std::vector<CodeSigningRecord> recordsWithSigningIdentifier(const std::string& identifier);
    std::vector<CodeSigningRecord> records();

    // Forces a re-read now (normally driven by change notifications).
    void reload();

private:
    struct State;
    void refreshLocked();
    void loadLocked();
    void watchLocked();

    const std::string directory_;
    std::mutex mutex_;
    std::unique_ptr<State> state_;
};

}  // namespace vsl
