// What tests read from vesselctl's manual page (docs/man/vesselctl.1.md) and its help.
#pragma once

#include <map>
#include <string>
#include <vector>

namespace vsl::test {

struct ManPageSubcommand {
    std::string name;
    std::vector<std::string> jsonKeys;  // the keys always printed under --json
};

// The subcommands of the page's SUBCOMMANDS section, in order.
std::vector<ManPageSubcommand> manPageSubcommands();

// The subcommand names `vesselctl --help` lists, in order.
std::vector<std::string> helpSubcommands();

}  // namespace vsl::test
