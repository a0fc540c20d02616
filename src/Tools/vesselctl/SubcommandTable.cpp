#include "SubcommandTable.h"

#include "Wait.h"

namespace {

constexpr Subcommand kSubcommands[] = {
    {"create", "ID [--class C]", "creates the container, or finds it", runCreate},
    {"lookup", "ID [--class C]", "finds an existing container", runLookup},
    {"list", "[--class C]", "the containers of a class", runList},
    {"delete", "ID [--class C]", "deletes a container", runDelete},
    {"info", "get|set ID KEY [VALUE] [--class C]", "reads or sets (no VALUE: removes) an info value", runInfo},
    {"du", "ID [--class C]", "disk usage of a container in bytes", runDiskUsage},
    {"groups", "[OWNER]", "the application group containers of an owner", runGroups},
    {"protect", "ID PROTECTION-CLASS [--class C]", "sets a container's protection class", runProtect},
    {"replace", "ID NEW-UUID [OLD-UUID] [--class C]", "puts a prepared container in the place of an old one",
     runReplace},
    {"wipe", "ID", "gives a plug-in data container a fresh skeleton", runWipe},
    {"status", "", "the daemon and its root at a glance", runStatus},
    {"doctor", "", "checks the root as an operator would; changes nothing", runDoctor},
    {"wait", "NAME [--timeout S]", "waits until vesseld posts a notification", runWait},
    {"metadata", "[KEY=VALUE...]", "a container's metadata with its info dictionary", runRequestSubcommand},
    {"recreate-structure", "[KEY=VALUE...]", "lays down a container's skeleton again", runRequestSubcommand},
    {"regenerate-uuid", "[KEY=VALUE...]", "gives a container a new UUID", runRequestSubcommand},
    {"group-ids", "[Identifier=OWNER]", "the group identifiers of an owner", runRequestSubcommand},
    {"system-container", "[Identifier=ID]", "the path of a system container", runRequestSubcommand},
    {"system-groups", "[Identifier=OWNER]", "the system group containers of an owner", runRequestSubcommand},
    {"system-group", "GROUP [Identifier=OWNER]", "the path of a system group container", runRequestSubcommand},
    {"wipe-content", "ID CLASS", "deletes a container's content", runRequestSubcommand},
    {"stage-shared", "GROUP SRC DEST", "moves content inside a system group container", runRequestSubcommand},
    {"assets-path", "[ID] [--relative] [--create]", "the user-managed assets directory", runRequestSubcommand},
    {"assets-delete", "ID PATH", "deletes a user-managed asset", runRequestSubcommand},
    {"migrate", "", "the data migration", runRequestSubcommand},
    {"migrate-user", "", "the per-user data migration", runRequestSubcommand},
    {"test-lock", "N on|off", "holds or releases a test lock", runRequestSubcommand},
    {"retry-test", "N", "crashes the daemon N times on purpose", runRequestSubcommand},
    {"keybag", "lock|unlock|state", "the device lock state of the root (no daemon needed)", runKeybag},
    {"upcall", "uid=N [KEY=VALUE...]", "asks the kernel upcall channel as the kernel would", runUpcall},
};

}  // namespace

std::span<const Subcommand> subcommands() { return kSubcommands; }

const Subcommand* findSubcommand(const std::string& name) {
    for (const auto& s : kSubcommands)
        if (name == s.name) return &s;
    return nullptr;
}
