#include "ManPage.h"

#include <sstream>

#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

namespace vsl::test {

std::vector<ManPageSubcommand> manPageSubcommands() {
    std::istringstream page(readFile(std::string(VESSEL_SOURCE_DIR) + "/docs/man/vesselctl.1.md"));
    std::vector<ManPageSubcommand> out;
    bool inSection = false;
    for (std::string line; std::getline(page, line);) {
        if (line.rfind("# ", 0) == 0) inSection = line == "# SUBCOMMANDS";
        if (!inSection) continue;
        if (line.rfind("## ", 0) == 0) {
            std::string heading = line.substr(3);
            out.push_back({heading.substr(0, heading.find(' ')), {}});
        } else if (line.rfind("JSON keys:", 0) == 0 && !out.empty()) {
            // Backquoted words before any parenthesis.
            std::string keys = line.substr(0, line.find('('));
            for (size_t at = keys.find('`'); at != std::string::npos; at = keys.find('`', at)) {
                size_t end = keys.find('`', at + 1);
                if (end == std::string::npos) break;
                out.back().jsonKeys.push_back(keys.substr(at + 1, end - at - 1));
                at = end + 1;
            }
        }
    }
    return out;
}

std::vector<std::string> helpSubcommands() {
    std::string out, err;
    runProgram({vesselctlPath(), "--help"}, &out, &err);
    std::istringstream help(out);
    std::vector<std::string> names;
    bool inList = false;
    for (std::string line; std::getline(help, line);) {
        if (line == "subcommands:") {
            inList = true;
        } else if (inList && line.empty()) {
            break;
        } else if (inList) {
            std::istringstream words(line);
            std::string name;
            words >> name;
            names.push_back(name);
        }
    }
    return names;
}

}  // namespace vsl::test
