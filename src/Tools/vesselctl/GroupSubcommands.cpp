// The group subcommands; the owner (or system identifier) is Identifier=, the
// caller's own when left out.
#include "Subcommands.h"

using namespace vsl;

std::optional<Dictionary> groupRequest(const std::string& name, const std::vector<std::string>& words,
                                       std::string* error) {
    const char* command = name == "group-ids"          ? "groupContainerIdentifiers"
                          : name == "system-container" ? "systemContainerPath"
                          : name == "system-groups"    ? "systemGroupContainers"
                          : name == "system-group"     ? "systemGroupContainerPath"
                                                       : nullptr;
    if (!command) return std::nullopt;
    Dictionary request = commandRequest(command);
    if (name == "system-group") {
        if (words.size() != 1) {
            *error = "system-group GROUP [Identifier=OWNER]";
            return Dictionary{};
        }
        request["GroupIdentifier"] = Value::string(words[0]);
    } else if (!words.empty()) {
        *error = name + " [Identifier=OWNER]";
    }
    return request;
}
