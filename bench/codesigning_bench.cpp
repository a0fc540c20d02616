// Code-signing registration (command 18) and query (command 19) through the mapping
// for 10,000 identifiers, against the cheapest SQLite doing the same rows; plus the
// per-message check of a client's own entitlements, a registration that drops a
// group (which recounts every stored entry), and the database's size on disk.
#include <sqlite3.h>
#include <sys/stat.h>

#include <cstdio>
#include <fstream>

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Platform/DeviceFacts.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "fs_bench_tree.h"

using namespace vsl;

namespace {

constexpr int kIdentifiers = 10000;
constexpr int kGroupDrops = 100;

std::string identifierAt(int i) {
    return "com.example.bench.app" + std::to_string(i);
}

Value infoFor(int i, bool withSecondGroup = true) {
    Array groups{Value::string("group.com.example.bench.g" + std::to_string(i % 50))};
    if (withSecondGroup) groups.push_back(Value::string("group.com.example.bench.shared"));
    Value entitlements = dict({
        {kVSLApplicationGroupsEntitlement, Value::array(std::move(groups))},
        {"application-identifier", Value::string("TEAM1234." + identifierAt(i))},
        {"com.example.team-identifier", Value::string("TEAM1234")},
        {"get-task-allow", Value::boolean(false)},
        {"com.example.push-environment", Value::string("production")},
        {"com.example.keychain-groups", Value::array({Value::string("TEAM1234." + identifierAt(i))})},
        {"com.example.networking", Value::boolean(true)},
        {"com.example.icloud-services", Value::array({Value::string("CloudDocuments")})},
    });
    Data hash(20);
    for (size_t b = 0; b < hash.size(); b++) hash[b] = static_cast<uint8_t>(i * 31 + b);
    return dict({{kVSLEntitlementsKey, entitlements},
                 {"CDHash", Value::data(std::move(hash))},
                 {"SigningIdentifier", Value::string(identifierAt(i))},
                 {"Version", Value::uint64(3)}});
}

uint64_t fileSize(const std::string& path) {
    struct stat st {};
    return ::stat(path.c_str(), &st) == 0 ? static_cast<uint64_t>(st.st_size) : 0;
}

void makeRoot(const std::string& root) {
    fsbench::runShell("mkdir -p '" + root + "/etc' '" + root + "/private/var/mobile'");
    std::ofstream(root + "/etc/passwd") << "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                           "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
    setSystemRoot(root);
    reloadDeviceFacts();
}

struct Figures {
    double registerMs = 0, queryMs = 0, callerCheckMs = 0, groupDropMs = 0;
    uint64_t dbBytes = 0, walBytes = 0;
};

Figures runMapping(const std::string& dir) {
    Figures f;
    auto mapping =
        VSLCodeSigningMapping::create(VSLSQLiteDB::initWithParentDirectoryURL(dir), VSLUserIdentityCache::create());
    VSLCodeSigningMapping::setSharedInstanceForTesting(mapping);
    std::vector<Value> infos;
    for (int i = 0; i < kIdentifiers; i++) infos.push_back(infoFor(i));
    Value options = dict({{kVSLOptionDataContainerClass, Value::uint64(2)}});

    f.registerMs = fsbench::millisecondsOf([&] {
        for (int i = 0; i < kIdentifiers; i++)
            if (mapping->processCodeSigningInfo(infos[i], identifierAt(i), options, VSLCommandQueue::create()) != 1)
                std::exit(1);
    });
    f.queryMs = fsbench::millisecondsOf([&] {
        for (int i = 0; i < kIdentifiers; i++)
            if (!mapping->getCodeSigningInfoForIdentifier(identifierAt(i))) std::exit(1);
    });
    // What every entitled message pays: its sender's unchanged entitlements.
    mapping->processCallerRegisteredEntitlements(dict({{"com.example.flag", Value::boolean(true)}}),
                                                 "com.example.client", VSLCommandQueue::create());
    f.callerCheckMs = fsbench::millisecondsOf([&] {
        for (int i = 0; i < kIdentifiers; i++)
            mapping->processCallerRegisteredEntitlements(dict({{"com.example.flag", Value::boolean(true)}}),
                                                         "com.example.client", VSLCommandQueue::create());
    });
    f.groupDropMs = fsbench::millisecondsOf([&] {
        for (int i = 0; i < kGroupDrops; i++)
            mapping->processCodeSigningInfo(infoFor(i, false), identifierAt(i), options, VSLCommandQueue::create());
    });
    VSLCodeSigningMapping::setSharedInstanceForTesting(nullptr);
    mapping.reset();  // closes the database, checkpointing the journal
    f.dbBytes = fileSize(dir + "/containers.sqlite3");
    f.walBytes = fileSize(dir + "/containers.sqlite3-wal");
    return f;
}

// The floor: the same rows with the same connection settings, a blob per key, one
// transaction per insert, and lookups through one reused statement.
std::pair<double, double> runFloor(const std::string& dir) {
    sqlite3* db = nullptr;
    sqlite3_open_v2((dir + "/floor.sqlite3").c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
    sqlite3_exec(db,
                 "PRAGMA auto_vacuum = FULL; PRAGMA locking_mode = EXCLUSIVE; PRAGMA journal_mode = WAL;"
                 "CREATE TABLE t (k TEXT NOT NULL UNIQUE, v BLOB NOT NULL);",
                 nullptr, nullptr, nullptr);
    std::vector<std::string> blobs;
    for (int i = 0; i < kIdentifiers; i++) blobs.push_back(*encodeBinaryPropertyList(infoFor(i), nullptr));
    sqlite3_stmt* insert = nullptr;
    sqlite3_prepare_v2(db, "INSERT INTO t (k, v) VALUES (?, ?)", -1, &insert, nullptr);
    double insertMs = fsbench::millisecondsOf([&] {
        for (int i = 0; i < kIdentifiers; i++) {
            std::string k = identifierAt(i);
            sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr);
            sqlite3_bind_text(insert, 1, k.c_str(), -1, SQLITE_STATIC);
            sqlite3_bind_blob(insert, 2, blobs[i].data(), static_cast<int>(blobs[i].size()), SQLITE_STATIC);
            sqlite3_step(insert);
            sqlite3_reset(insert);
            sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr);
        }
    });
    sqlite3_finalize(insert);
    sqlite3_stmt* select = nullptr;
    sqlite3_prepare_v2(db, "SELECT v FROM t WHERE k = ?", -1, &select, nullptr);
    size_t bytes = 0;
    double selectMs = fsbench::millisecondsOf([&] {
        for (int i = 0; i < kIdentifiers; i++) {
            std::string k = identifierAt(i);
            sqlite3_bind_text(select, 1, k.c_str(), -1, SQLITE_STATIC);
            if (sqlite3_step(select) == SQLITE_ROW) bytes += static_cast<size_t>(sqlite3_column_bytes(select, 0));
            sqlite3_reset(select);
        }
    });
    sqlite3_finalize(select);
    sqlite3_close(db);
    if (bytes == 0) std::exit(1);
    return {insertMs, selectMs};
}

}  // namespace

int main() {
    std::string scratch = fsbench::makeScratchDir();
    makeRoot(scratch + "/root");
    std::vector<double> reg, query, caller, drop, floorInsert, floorSelect;
    Figures last;
    for (int round = 0; round < 3; round++) {
        std::string dir = scratch + "/round" + std::to_string(round);
        fsbench::runShell("mkdir -p '" + dir + "'");
        last = runMapping(dir);
        reg.push_back(last.registerMs);
        query.push_back(last.queryMs);
        caller.push_back(last.callerCheckMs);
        drop.push_back(last.groupDropMs);
        auto [fi, fs] = runFloor(dir);
        floorInsert.push_back(fi);
        floorSelect.push_back(fs);
    }
    std::fprintf(stderr, "identifiers: %d, info blob ~%zu bytes; registration dropping a group (recounts %d entries) "
                 "%.2f ms; database %llu bytes (%.0f per identifier), -wal %llu bytes\n",
                 kIdentifiers, encodeBinaryPropertyList(infoFor(0), nullptr)->size(), kIdentifiers,
                 fsbench::median(drop) / kGroupDrops, static_cast<unsigned long long>(last.dbBytes),
                 static_cast<double>(last.dbBytes) / kIdentifiers, static_cast<unsigned long long>(last.walBytes));
    fsbench::printRatio("command 18 (register) / durable sqlite insert", reg, floorInsert, "<= 1.3");
    fsbench::printRatio("command 19 (query) / sqlite select", query, floorSelect, "<= 2.0");
    vslbench::printFigure("caller entitlement check, unchanged (per message)",
                          fsbench::median(caller) * 1000 / kIdentifiers, "us", "(none)");
    fsbench::runShell("rm -rf '" + scratch + "'");
    return 0;
}
