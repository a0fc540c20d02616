#include "Platform/SandboxState.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>
#include <map>
#include <mutex>
#include <tuple>
#include <unordered_map>

#include "Platform/DirectoryEntries.h"
#include "Platform/DurableIO.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

constexpr char kMagic[8] = {'V', 'S', 'L', 'S', 'B', 'X', '0', '1'};
constexpr uint32_t kMaxPayload = 1u << 20;
constexpr uint32_t kNoPath = 0xFFFFFFFFu;
constexpr size_t kRecordHeader = 4 + 8;  // payload length, checksum

using ItemKey = std::tuple<uint64_t, int32_t, std::string>;

struct Table {
    bool loaded = false;
    bool rewrite = false;  // the file holds more than the items (torn tail, old boot): rewrite before appending
    dev_t dev = 0;
    ino_t ino = 0;  // 0: no file yet
    off_t size = 0;
    struct timespec mtime {};
    size_t records = 0;
    std::map<ItemKey, std::string> items;
};

std::mutex gMutex;
std::unordered_map<std::string, Table> gTables;  // by table path

const std::string& bootID() {
    static const std::string id = [] {
        std::ifstream in("/proc/sys/kernel/random/boot_id");
        std::string s;
        std::getline(in, s);
        return s;
    }();
    return id;
}

std::string tablePath(uid_t uid) { return joinPath(SandboxState::directory(), "uid-" + std::to_string(uid)); }

// Tables hold paths below the system root without the root ("private/var/..."), and
// any other path as it is (absolute). With "/" as the root every path is absolute.
std::optional<std::string> storedPath(const std::optional<std::string>& hostPath) {
    if (!hostPath || systemRootIsSlash()) return hostPath;
    std::string inside = unrootedPath(*hostPath);
    if (inside == *hostPath) return hostPath;
    return inside.substr(1);
}

std::string hostPath(const std::string& stored) {
    return stored.empty() || stored[0] == '/' ? stored : rootedPath(stored);
}

void putU32(std::string& out, uint32_t v) {
    for (int i = 0; i < 4; i++) out.push_back(static_cast<char>(v >> (8 * i)));
}
void putU64(std::string& out, uint64_t v) {
    for (int i = 0; i < 8; i++) out.push_back(static_cast<char>(v >> (8 * i)));
}
uint32_t getU32(const char* p) {
    uint32_t v = 0;
    for (int i = 0; i < 4; i++) v |= static_cast<uint32_t>(static_cast<unsigned char>(p[i])) << (8 * i);
    return v;
}
uint64_t getU64(const char* p) {
    uint64_t v = 0;
    for (int i = 0; i < 8; i++) v |= static_cast<uint64_t>(static_cast<unsigned char>(p[i])) << (8 * i);
    return v;
}

// Detects a record cut short by a crash; the directory is root's, so no forgery to fear.
uint64_t checksum(const char* p, size_t n) {
    uint64_t h = 1469598103934665603ull;
    for (size_t i = 0; i < n; i++) {
        h ^= static_cast<unsigned char>(p[i]);
        h *= 1099511628211ull;
    }
    return h;
}

std::string header() {
    std::string h(kMagic, sizeof kMagic);
    putU32(h, static_cast<uint32_t>(bootID().size()));
    h += bootID();
    return h;
}

void appendRecord(std::string& out, const SandboxContainerItemChange& c) {
    std::string payload;
    putU64(payload, c.type);
    putU32(payload, static_cast<uint32_t>(c.personaID));
    putU32(payload, static_cast<uint32_t>(c.identifier.size()));
    payload += c.identifier;
    putU32(payload, c.path ? static_cast<uint32_t>(c.path->size()) : kNoPath);
    if (c.path) payload += *c.path;
    putU32(out, static_cast<uint32_t>(payload.size()));
    putU64(out, checksum(payload.data(), payload.size()));
    out += payload;
}

// One record at `p`; false when what is there is not a whole, intact record.
bool readRecord(const char* p, const char* end, SandboxContainerItemChange* c, size_t* used) {
    if (end - p < static_cast<ptrdiff_t>(kRecordHeader)) return false;
    uint32_t length = getU32(p);
    if (length > kMaxPayload || static_cast<size_t>(end - p) - kRecordHeader < length) return false;
    const char* q = p + kRecordHeader;
    if (checksum(q, length) != getU64(p + 4)) return false;
    const char* e = q + length;
    if (e - q < 16) return false;
    c->type = getU64(q);
    c->personaID = static_cast<int32_t>(getU32(q + 8));
    uint32_t idLength = getU32(q + 12);
    q += 16;
    if (static_cast<size_t>(e - q) < static_cast<size_t>(idLength) + 4) return false;
    c->identifier.assign(q, idLength);
    q += idLength;
    uint32_t pathLength = getU32(q);
    q += 4;
    if (pathLength == kNoPath) {
        c->path.reset();
    } else {
        if (static_cast<size_t>(e - q) != pathLength) return false;
        c->path = std::string(q, pathLength);
        q += pathLength;
    }
    if (q != e) return false;
    *used = kRecordHeader + length;
    return true;
}

// True when the change alters the table.
bool apply(Table& t, const SandboxContainerItemChange& c) {
    ItemKey key{c.type, c.personaID, c.identifier};
    auto it = t.items.find(key);
    if (!c.path) {
        if (it == t.items.end()) return false;
        t.items.erase(it);
        return true;
    }
    if (it != t.items.end() && it->second == *c.path) return false;
    t.items[key] = *c.path;
    return true;
}

void remember(const struct stat& st, Table& t) {
    t.dev = st.st_dev;
    t.ino = st.st_ino;
    t.size = st.st_size;
    t.mtime = st.st_mtim;
}

bool sameFile(const struct stat& st, const Table& t) {
    return st.st_dev == t.dev && st.st_ino == t.ino && st.st_size == t.size &&
           st.st_mtim.tv_sec == t.mtime.tv_sec && st.st_mtim.tv_nsec == t.mtime.tv_nsec;
}

int load(const std::string& path, Table& t) {
    t = Table();
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!fd) {
        if (errno != ENOENT) return errno;
        t.loaded = true;
        return 0;
    }
    struct stat st;
    if (::fstat(fd.get(), &st) != 0) return errno;
    std::string bytes(static_cast<size_t>(st.st_size), '\0');
    size_t got = 0;
    while (got < bytes.size()) {
        ssize_t n = ::read(fd.get(), bytes.data() + got, bytes.size() - got);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return errno;
        if (n == 0) break;
        got += static_cast<size_t>(n);
    }
    bytes.resize(got);
    t.loaded = true;
    remember(st, t);
    t.size = static_cast<off_t>(got);
    std::string h = header();
    if (bytes.compare(0, h.size(), h) != 0) {
        // Written under another boot, or not a table at all: no items.
        t.rewrite = true;
        return 0;
    }
    const char* p = bytes.data() + h.size();
    const char* end = bytes.data() + bytes.size();
    SandboxContainerItemChange c;
    size_t used = 0;
    while (p < end && readRecord(p, end, &c, &used)) {
        apply(t, c);
        t.records++;
        p += used;
    }
    t.rewrite = p != end;
    return 0;
}

// Brings the in-memory table up to date with its file.
int refresh(const std::string& path, Table& t) {
    if (!t.loaded) return load(path, t);
    struct stat st;
    if (::lstat(path.c_str(), &st) != 0) {
        if (errno != ENOENT) return errno;
        if (t.ino != 0) {  // removed behind our back: a boot cleared it
            t = Table();
            t.loaded = true;
        }
        return 0;
    }
    if (!sameFile(st, t)) return load(path, t);
    return 0;
}

int ensureDirectory() {
    std::string dir = SandboxState::directory();
    for (const std::string& d : {parentPath(parentPath(dir)), parentPath(dir), dir}) {
        int rc = durable::makeDirectory(d, d == dir ? 0700 : 0755);
        if (rc != 0 && rc != EEXIST) return rc;
    }
    return 0;
}

int rewriteWhole(const std::string& path, Table& t) {
    if (int rc = ensureDirectory()) return rc;
    std::string bytes = header();
    for (const auto& [key, itemPath] : t.items)
        appendRecord(bytes, {std::get<0>(key), std::get<1>(key), std::get<2>(key), itemPath});
    if (int rc = durable::writeFileAtomically(path, bytes.data(), bytes.size(), 0600)) return rc;
    struct stat st;
    if (::lstat(path.c_str(), &st) != 0) return errno;
    remember(st, t);
    t.records = t.items.size();
    t.rewrite = false;
    return 0;
}

// No fsync: a table never outlives the boot that wrote it (another boot id reads as
// empty), and what a crashed daemon wrote is still in the page cache.
int append(const std::string& path, Table& t, const std::vector<SandboxContainerItemChange>& changes) {
    std::string bytes;
    for (const auto& c : changes) appendRecord(bytes, c);
    durable::step("write", path);
    UniqueFd fd(::open(path.c_str(), O_WRONLY | O_APPEND | O_CLOEXEC | O_NOFOLLOW));
    if (!fd) return errno;
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = ::write(fd.get(), bytes.data() + done, bytes.size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return errno;
        done += static_cast<size_t>(n);
    }
    struct stat st;
    if (::fstat(fd.get(), &st) != 0) return errno;
    remember(st, t);
    t.records += changes.size();
    return 0;
}

// Removes the directory's entries that `which` picks; the caller holds gMutex.
int removeEntries(const std::function<bool(const std::string&)>& which) {
    std::string dir = SandboxState::directory();
    UniqueFd fd(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW));
    if (!fd) return errno == ENOENT ? 0 : errno;
    std::vector<DirectoryEntry> entries;
    if (int rc = readDirectoryEntries(fd.get(), &entries)) return rc;
    int rc = 0;
    for (const auto& e : entries) {
        if (!which(e.name)) continue;
        int err = durable::removeFile(joinPath(dir, e.name));
        if (err != 0 && err != ENOENT && rc == 0) rc = err;
    }
    return rc;
}

}  // namespace

std::string SandboxState::directory() { return rootedPath("/run/vesseld/sandbox"); }

int SandboxState::setItem(uid_t uid, const SandboxContainerItemChange& change) { return setItems(uid, {change}); }

int SandboxState::setItems(uid_t uid, const std::vector<SandboxContainerItemChange>& changes) {
    std::string path = tablePath(uid);
    std::lock_guard<std::mutex> lock(gMutex);
    Table& t = gTables[path];
    if (int rc = refresh(path, t)) return rc;
    std::vector<SandboxContainerItemChange> effective;
    for (auto c : changes) {
        c.path = storedPath(c.path);
        if (apply(t, c)) effective.push_back(std::move(c));
    }
    if (effective.empty()) return 0;
    // Appending after a torn record would hide everything after it; compact instead.
    bool whole = t.ino == 0 || t.rewrite || t.records + effective.size() > 2 * t.items.size() + 1024;
    int rc = whole ? rewriteWhole(path, t) : append(path, t, effective);
    if (rc != 0) t.loaded = false;  // memory ran ahead of the file: re-read next time
    return rc;
}

int SandboxState::iterateItems(uid_t uid, const std::function<void(const SandboxContainerItem&)>& callback) {
    std::string path = tablePath(uid);
    std::vector<SandboxContainerItem> items;
    {
        std::lock_guard<std::mutex> lock(gMutex);
        Table& t = gTables[path];
        if (int rc = refresh(path, t)) return rc;
        items.reserve(t.items.size());
        for (const auto& [key, itemPath] : t.items)
            items.push_back({std::get<0>(key), std::get<1>(key), std::get<2>(key), hostPath(itemPath)});
    }
    for (const auto& item : items) callback(item);
    return 0;
}

int SandboxState::clearForBoot() {
    std::lock_guard<std::mutex> lock(gMutex);
    gTables.clear();
    return removeEntries([](const std::string&) { return true; });
}

int SandboxState::removeTemporaryFiles() {
    std::lock_guard<std::mutex> lock(gMutex);
    // The atomic writer's temporaries: ".uid-N.tmp-UUID" beside "uid-N".
    return removeEntries([](const std::string& name) {
        return name.rfind(".uid-", 0) == 0 && name.find(".tmp-") != std::string::npos;
    });
}

}  // namespace vsl
