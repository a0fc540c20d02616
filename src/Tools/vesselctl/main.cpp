// vesselctl: talks to vesseld.
//   vesselctl [--root DIR | --socket PATH] [--json | --plist] [--timeout SECONDS] COMMAND [key=value ...]
// COMMAND is a command name (see `vesselctl help`) or its number.
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "Client/VSLArguments.h"
#include "Client/VSLConnection.h"
#include "Client/VSLProtocol.h"
#include "Client/VSLUpcallClient.h"
#include "Platform/PropertyList.h"
#include "ContentSubcommands.h"
#include "Keybag.h"
#include "Subcommands.h"
#include "Upcall.h"
#include "Wait.h"

using namespace vsl;
using namespace vsl::client;

namespace {

int usage(FILE* out) {
    std::fprintf(out,
                 "usage: vesselctl [--root DIR | --socket PATH] [--json | --plist] [--timeout SECONDS] COMMAND [key=value ...]\n"
                 "\n"
                 "Sends one command to vesseld and prints its reply. Values are typed by key\n"
                 "(Identifier=com.example.app ContainerClass=2 CreateIfNecessary=true UUID=...);\n"
                 "key:type=value names a type: str u64 i64 bool uuid null plist(=@FILE) u64s strs uuids.\n"
                 "--json prints the reply as JSON, --plist as a binary property list.\n"
                 "The root defaults to $VESSELD_ROOT or /. Exit status: 0 when ReplyError is 1,\n"
                 "1 for any other result, 2 for a usage error, 3 when the daemon cannot be reached,\n"
                 "refuses the connection or does not answer.\n"
                 "\n"
                 "commands:\n");
    for (uint64_t i = 0; i < kVSLProtocolCommandCount; i++) std::fprintf(out, "  %2llu  %s\n", (unsigned long long)i, commandName(i));
    std::fprintf(out, "\nsubcommands:\n%s%s%s%s", kSubcommandUsage, kGroupSubcommandUsage, kContentSubcommandUsage,
                 kUpcallUsage);
    std::fprintf(out,
                 "\n"
                 "replace (replaceContainer): puts a prepared container in the place of an old one\n"
                 "  OldIdentifier=ID OldContainerClass=N OldContainerUUID=UUID [OldPersonaUniqueString=S]\n"
                 "  NewIdentifier=ID NewContainerClass=N NewContainerUUID=UUID [NewPersonaUniqueString=S]\n"
                 "  Without the Old keys the new container is made permanent in its class.\n");
    std::fprintf(out, "%s", kWaitUsage);
    return out == stdout ? 0 : 2;
}

}  // namespace

int main(int argc, char** argv) {
    std::string root = std::getenv("VESSELD_ROOT") ? std::getenv("VESSELD_ROOT") : "/";
    std::string socketPath;
    bool asJson = false;
    bool asPlist = false;
    long timeoutSeconds = 60;
    int i = 1;
    for (; i < argc; i++) {
        std::string a = argv[i];
        if (a == "--root" && i + 1 < argc) {
            root = argv[++i];
        } else if (a == "--socket" && i + 1 < argc) {
            socketPath = argv[++i];
        } else if (a == "--json") {
            asJson = true;
        } else if (a == "--plist") {
            asPlist = true;
        } else if (a == "--timeout" && i + 1 < argc) {
            timeoutSeconds = std::strtol(argv[++i], nullptr, 10);
        } else if (a == "-h" || a == "--help" || a == "help") {
            return usage(stdout);
        } else if (!a.empty() && a[0] == '-') {
            std::fprintf(stderr, "vesselctl: unknown option %s\n", a.c_str());
            return usage(stderr);
        } else {
            break;
        }
    }
    if (i >= argc) return usage(stderr);
    if (std::string(argv[i]) == "upcall") {
        if (socketPath.empty()) socketPath = VSLUpcallClient::socketPathForSystemRoot(root);
        return runUpcallSubcommand(socketPath, asJson, timeoutSeconds, argc, argv, i + 1);
    }

    if (std::string(argv[i]) == "keybag") return runKeybagCommand(root, argc - i, argv + i, asJson);
    if (std::string(argv[i]) == "wait") return runWaitCommand(root, timeoutSeconds, argc - i, argv + i);

    std::string subcommandError;
    std::optional<Dictionary> subcommand = subcommandRequest(argc, argv, &i, &subcommandError);
    if (!subcommandError.empty()) {
        std::fprintf(stderr, "vesselctl: %s\n", subcommandError.c_str());
        return 2;
    }
    std::string name = subcommand ? std::string() : argv[i++];
    std::optional<uint64_t> number = subcommand ? std::optional<uint64_t>(0)
                                                : commandNumberForName(name == "replace" ? "replaceContainer" : name.c_str());
    if (!number) {
        char* end = nullptr;
        unsigned long long n = std::strtoull(name.c_str(), &end, 10);
        if (name.empty() || *end) {
            std::fprintf(stderr, "vesselctl: unknown command \"%s\" (vesselctl help lists them)\n", name.c_str());
            return 2;
        }
        number = n;
    }
    Dictionary request = subcommand ? *subcommand : Dictionary{{"Command", Value::uint64(*number)}};
    for (; i < argc; i++) {
        std::string error;
        auto kv = parseArgument(argv[i], &error);
        if (!kv) {
            std::fprintf(stderr, "vesselctl: %s\n", error.c_str());
            return 2;
        }
        request.insert_or_assign(kv->first, kv->second);
    }

    std::string error;
    if (socketPath.empty()) socketPath = VSLConnection::socketPathForSystemRoot(root);
    auto connection = VSLConnection::connect(socketPath, &error);
    if (!connection) {
        if (errno == ENOENT || errno == ECONNREFUSED) {
            std::fprintf(stderr,
                         "vesselctl: vesseld is not running (nothing answers at %s)\n"
                         "  start one on a scratch root with: vesseld --root DIR --init\n",
                         socketPath.c_str());
        } else {
            std::fprintf(stderr, "vesselctl: cannot reach vesseld: %s\n", error.c_str());
        }
        return 3;
    }
    VSLReply reply = connection->sendRequest(Value::dictionary(std::move(request)),
                                             std::chrono::milliseconds(timeoutSeconds * 1000));
    if (!reply.ok()) {
        switch (reply.status) {
        case VSLConnectionStatus::Refused:
            std::fprintf(stderr,
                         "vesselctl: vesseld refused the connection: %s\n"
                         "  this user holds as many connections to vesseld as it may; close some and retry\n",
                         reply.error.c_str());
            break;
        case VSLConnectionStatus::Closed:
            // Whether anything still answers tells a stopped daemon from a dropped connection.
            if (VSLConnection::connect(socketPath)) {
                std::fprintf(stderr, "vesselctl: vesseld closed the connection before answering (%s)\n",
                             reply.error.c_str());
            } else {
                std::fprintf(stderr,
                             "vesselctl: vesseld stopped before answering; vesseld.log in\n"
                             "  %s/private/var/root/Library/Logs/Vesselry says why\n",
                             root == "/" ? "" : root.c_str());
            }
            break;
        case VSLConnectionStatus::Timeout:
            std::fprintf(stderr, "vesselctl: no reply from vesseld within %ld s\n", timeoutSeconds);
            break;
        default:
            std::fprintf(stderr, "vesselctl: %s: %s\n", statusName(reply.status), reply.error.c_str());
            break;
        }
        return 3;
    }
    if (asPlist) {
        auto bytes = encodeBinaryPropertyList(reply.body, &error);
        if (!bytes) {
            std::fprintf(stderr, "vesselctl: reply cannot be written as a property list: %s\n", error.c_str());
            return 3;
        }
        std::fwrite(bytes->data(), 1, bytes->size(), stdout);
    } else if (asJson)
        std::printf("%s\n", renderJson(reply.body).c_str());
    else
        std::printf("%s", renderHuman(reply.body).c_str());
    const Value* code = reply.body.find("ReplyError");
    return code && code->uint64Value() == 1u ? 0 : 1;
}
