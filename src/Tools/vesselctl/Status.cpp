// vesselctl status: the daemon and its root at a glance, from the files below the root
// and from requests that change nothing (personaUniqueStrings, containersWithClass).
// Keys (--json): Answering Pid Socket Root Build LockState FirstBootDone
// ContainersPerClass PendingProtectionChanges ReplaceJournals DeathRowItems.
#include <chrono>
#include <cstdio>

#include "Client/VSLArguments.h"
#include "Client/VSLConnection.h"
#include "Daemon/Core/VSLContainerClass.h"
#include "Daemon/Migration/VSLMigrationStatus.h"
#include "Platform/Keybag.h"
#include "Platform/SystemRoot.h"
#include "RootProbe.h"
#include "Subcommands.h"
#include "SubcommandTable.h"

using namespace vsl;
using namespace vsl::client;

namespace {

Value countOrNull(long n) { return n < 0 ? Value() : Value::int64(n); }

// Containers per class short name, or null when the daemon does not answer.
Value containersPerClass(VSLConnection& connection, long timeoutSeconds) {
    Dictionary counts;
    for (VSLContainerClass c = 1; isValidContainerClass(c); c++) {
        Dictionary request = commandRequest("containersWithClass");
        request["ContainerClass"] = Value::uint64(c);
        VSLReply reply = connection.sendRequest(Value::dictionary(std::move(request)),
                                                std::chrono::milliseconds(timeoutSeconds * 1000));
        const Value* ids = reply.ok() ? reply.body.find("ReplyIdsArray") : nullptr;
        counts[containerClassShortName(c)] = ids && ids->arrayValue() ? Value::int64(ids->arrayValue()->size()) : Value();
    }
    return Value::dictionary(std::move(counts));
}

}  // namespace

int runStatus(const CtlOptions& options, const SubcommandArgs& args) {
    if (!args.words.empty()) return printUsageError(options, "status");
    setSystemRoot(options.root);
    const std::string socketPath = options.daemonSocketPath();
    Dictionary status;
    bool answering = false;
    Value perClass;
    if (auto connection = VSLConnection::connect(socketPath)) {
        VSLReply reply = connection->sendRequest(Value::dictionary(commandRequest("personaUniqueStrings")),
                                                 std::chrono::milliseconds(options.timeoutSeconds * 1000));
        answering = reply.ok();
        if (answering) perClass = containersPerClass(*connection, options.timeoutSeconds);
    }
    auto pid = answering ? daemonPid(socketPath) : std::nullopt;
    auto version = currentSystemVersionDictionary();
    auto build = version ? version->find("BUILD_ID") : Dictionary::const_iterator();
    const bool hasBuild = version && build != version->end();
    const int lock = keybagLockState();
    status["Answering"] = Value::boolean(answering);
    status["Pid"] = pid ? Value::int64(*pid) : Value();
    status["Socket"] = Value::string(socketPath);
    status["Root"] = Value::string(systemRoot());
    status["Build"] = hasBuild ? build->second : Value();
    status["LockState"] = Value::string(lock == kKeybagLocked ? "locked" : lock == kKeybagUnlocked ? "unlocked" : "transition");
    status["FirstBootDone"] = Value::boolean(firstBootWorkDone());
    status["ContainersPerClass"] = perClass;
    status["PendingProtectionChanges"] = countOrNull(entryCount(kPendingProtectionDirectory));
    status["ReplaceJournals"] = countOrNull(entryCount(kReplaceJournalDirectory));
    status["DeathRowItems"] = countOrNull(entryCount(kDeathRowDirectory));
    const Value out = Value::dictionary(std::move(status));
    if (options.json)
        std::printf("%s\n", renderJson(out).c_str());
    else
        std::printf("%s", renderHuman(out).c_str());
    return answering ? kExitSuccess : kExitUnreachable;
}
