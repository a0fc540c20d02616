// vesselctl: talks to vesseld.
//   vesselctl [--root DIR | --socket PATH] [--json | --plist] [--timeout SECONDS] SUBCOMMAND [ARGS...]
//   vesselctl [options] COMMAND [key=value ...]     (a protocol command by name or number)
#include <cstdio>
#include <cstdlib>
#include <string>

#include "Client/VSLProtocol.h"
#include "SubcommandTable.h"
#include "VerbArguments.h"

using namespace vsl;

namespace {

int usage(FILE* out) {
    std::fprintf(out,
                 "usage: vesselctl [--root DIR | --socket PATH] [--json | --plist] [--timeout SECONDS] SUBCOMMAND "
                 "[ARGS...]\n"
                 "       vesselctl [options] COMMAND [key=value ...]\n"
                 "\n"
                 "Containers are named by identifier and class: --class takes a number 1-13 or a short\n"
                 "name (data bundle plugin pluginData group system systemGroup, or any name of the\n"
                 "class table: app appData vpn vpnData appGroup framework ipcService daemon tempDir\n"
                 "systemData); data when left out. key=value arguments add to the request; values are\n"
                 "typed by key, key:type=value names a type: str u64 i64 bool uuid null plist(=@FILE)\n"
                 "u64s strs uuids. --json prints JSON (failures as {\"error\": CODE, \"name\": NAME,\n"
                 "\"message\": TEXT}), --plist a binary property list. The root defaults to\n"
                 "$VESSELD_ROOT or /. Exit status: 0 success, 1 any other result, 2 usage error,\n"
                 "3 the daemon cannot be reached, refuses the connection or does not answer.\n"
                 "\n"
                 "subcommands:\n");
    for (const auto& s : subcommands()) {
        std::string line = std::string(s.name) + (*s.synopsis ? " " : "") + s.synopsis;
        std::fprintf(out, "  %-44s %s\n", line.c_str(), s.summary);
    }
    std::fprintf(out,
                 "\nreplace without words sends the keys as given:\n"
                 "  OldIdentifier=ID OldContainerClass=N OldContainerUUID=UUID [OldPersonaUniqueString=S]\n"
                 "  NewIdentifier=ID NewContainerClass=N NewContainerUUID=UUID [NewPersonaUniqueString=S]\n"
                 "  Without the Old keys the new container is made permanent in its class.\n");
    std::fprintf(out, "\ncommands (the protocol's, by name or number):\n");
    for (uint64_t i = 0; i < kVSLProtocolCommandCount; i++)
        std::fprintf(out, "  %2llu  %s\n", (unsigned long long)i, commandName(i));
    return out == stdout ? kExitSuccess : kExitUsage;
}

// A protocol command by name or number with typed key=value arguments.
int runRawCommand(const CtlOptions& options, const SubcommandArgs& args) {
    std::optional<uint64_t> number = commandNumberForName(args.name.c_str());
    if (!number) number = parseNumber(args.name);
    if (!number) {
        printFailure(options, kExitUsage, 0, "Usage", "unknown subcommand \"" + args.name + "\"");
        return usage(stderr);
    }
    Dictionary request{{"Command", Value::uint64(*number)}};
    for (const auto& word : args.words) {
        std::string error;
        auto kv = parseKeyValue(word, &error);
        if (!kv) return printUsageError(options, args.name + " [key=value ...]\n  " + error);
        request.insert_or_assign(kv->first, kv->second);
    }
    return sendAndPrint(options, request);
}

}  // namespace

int main(int argc, char** argv) {
    CtlOptions options;
    options.root = std::getenv("VESSELD_ROOT") ? std::getenv("VESSELD_ROOT") : "/";
    int i = 1;
    for (; i < argc; i++) {
        std::string a = argv[i];
        if (a == "--root" && i + 1 < argc) {
            options.root = argv[++i];
        } else if (a == "--socket" && i + 1 < argc) {
            options.socketPath = argv[++i];
        } else if (a == "--json") {
            options.json = true;
        } else if (a == "--plist") {
            options.plist = true;
        } else if (a == "--timeout" && i + 1 < argc) {
            options.timeoutSeconds = std::strtol(argv[++i], nullptr, 10);
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
    // --json and --plist may follow the subcommand too.
    SubcommandArgs args{argv[i], {}};
    for (i++; i < argc; i++) {
        std::string a = argv[i];
        if (a == "--json")
            options.json = true;
        else if (a == "--plist")
            options.plist = true;
        else
            args.words.push_back(a);
    }
    if (const Subcommand* s = findSubcommand(args.name)) return s->run(options, args);
    return runRawCommand(options, args);
}
