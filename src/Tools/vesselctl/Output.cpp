#include "Output.h"

#include <cerrno>
#include <cstdio>

#include "Client/VSLArguments.h"
#include "Client/VSLConnection.h"
#include "Daemon/Core/VSLErrorNames.h"
#include "Platform/PropertyList.h"

using namespace vsl;
using namespace vsl::client;

std::string CtlOptions::daemonSocketPath() const {
    return socketPath.empty() ? VSLConnection::socketPathForSystemRoot(root) : socketPath;
}

std::string jsonString(const std::string& text) { return renderJson(Value::string(text)); }

int printFailure(const CtlOptions& options, int status, uint64_t code, const std::string& name,
                 const std::string& message) {
    std::fprintf(stderr, "vesselctl: %s\n", message.c_str());
    if (options.json)
        std::printf("{\"error\":%llu,\"name\":%s,\"message\":%s}\n", (unsigned long long)code, jsonString(name).c_str(),
                    jsonString(message).c_str());
    return status;
}

int printUsageError(const CtlOptions& options, const std::string& usage) {
    return printFailure(options, kExitUsage, 0, "Usage", "usage: vesselctl " + usage);
}

std::optional<Value> exchange(const CtlOptions& options, const Dictionary& request, int* status) {
    *status = kExitUnreachable;
    std::string error;
    const std::string socketPath = options.daemonSocketPath();
    auto connection = VSLConnection::connect(socketPath, &error);
    if (!connection) {
        if (errno == ENOENT || errno == ECONNREFUSED)
            printFailure(options, kExitUnreachable, 0, "NotRunning",
                         "vesseld is not running (nothing answers at " + socketPath +
                             ")\n  start one on a scratch root with: vesseld --root DIR --init");
        else
            printFailure(options, kExitUnreachable, 0, "Unreachable", "cannot reach vesseld: " + error);
        return std::nullopt;
    }
    VSLReply reply = connection->sendRequest(Value::dictionary(request),
                                             std::chrono::milliseconds(options.timeoutSeconds * 1000));
    switch (reply.status) {
    case VSLConnectionStatus::Ok:
        *status = kExitSuccess;
        return reply.body;
    case VSLConnectionStatus::Refused:
        printFailure(options, kExitUnreachable, 0, "Refused",
                     "vesseld refused the connection: " + reply.error +
                         "\n  this user holds as many connections to vesseld as it may; close some and retry");
        break;
    case VSLConnectionStatus::Closed:
        // Whether anything still answers tells a stopped daemon from a dropped connection.
        if (VSLConnection::connect(socketPath))
            printFailure(options, kExitUnreachable, 0, "Closed",
                         "vesseld closed the connection before answering (" + reply.error + ")");
        else
            printFailure(options, kExitUnreachable, 0, "Stopped",
                         "vesseld stopped before answering; vesseld.log in\n  " +
                             (options.root == "/" ? std::string() : options.root) +
                             "/private/var/root/Library/Logs/Vesselry says why");
        break;
    case VSLConnectionStatus::Timeout:
        printFailure(options, kExitUnreachable, 0, "Timeout",
                     "no reply from vesseld within " + std::to_string(options.timeoutSeconds) + " s");
        break;
    default:
        printFailure(options, kExitUnreachable, 0, statusName(reply.status), reply.error);
        break;
    }
    return std::nullopt;
}

int printReply(const CtlOptions& options, const Value& reply) {
    const Value* code = reply.find("ReplyError");
    const uint64_t result = code ? code->uint64Value().value_or(0) : 0;
    if (options.plist) {
        std::string error;
        auto bytes = encodeBinaryPropertyList(reply, &error);
        if (!bytes) return printFailure(options, kExitUnreachable, 0, "BadReply",
                                        "reply cannot be written as a property list: " + error);
        std::fwrite(bytes->data(), 1, bytes->size(), stdout);
    } else if (options.json && result != 1) {
        printFailure(options, kExitFailed, result, errorCodeName(result),
                     std::string("vesseld answered ") + std::to_string(result) + " (" + errorCodeName(result) + ")");
    } else if (options.json) {
        std::printf("%s\n", renderJson(reply).c_str());
    } else {
        std::printf("%s", renderHuman(reply).c_str());
        if (result != 1) std::fprintf(stderr, "vesselctl: vesseld answered %llu (%s)\n", (unsigned long long)result,
                                      errorCodeName(result));
    }
    return result == 1 ? kExitSuccess : kExitFailed;
}

int sendAndPrint(const CtlOptions& options, const Dictionary& request) {
    int status = 0;
    auto reply = exchange(options, request, &status);
    return reply ? printReply(options, *reply) : status;
}
