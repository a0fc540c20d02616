// The group subcommands; the owner (or system identifier) is Identifier=, the
// caller's own when left out.
#include "Subcommands.h"

#include "Client/VSLProtocol.h"

using namespace vsl;

const char* const kGroupSubcommandUsage =
    "  groups | group-ids | system-container | system-groups | system-group GROUP   ([Identifier=OWNER])\n";

std::optional<Dictionary> groupSubcommandRequest(int argc, char** argv, int* index, std::string* error) {
    const int i = *index;
    const std::string word = argv[i];
    const char* command = word == "groups"             ? "createOrLookupGroupContainers"
                          : word == "group-ids"        ? "groupContainerIdentifiers"
                          : word == "system-container" ? "systemContainerPath"
                          : word == "system-groups"    ? "systemGroupContainers"
                          : word == "system-group"     ? "systemGroupContainerPath"
                                                       : nullptr;
    if (!command) return std::nullopt;
    Dictionary request{{"Command", Value::uint64(*commandNumberForName(command))}};
    *index = i + 1;
    if (word == "system-group") {
        if (i + 1 >= argc || std::string(argv[i + 1]).find('=') != std::string::npos) {
            *error = "usage: vesselctl system-group GROUP [Identifier=OWNER]";
            return Dictionary{};
        }
        request["GroupIdentifier"] = Value::string(argv[i + 1]);
        *index = i + 2;
    }
    return request;
}
