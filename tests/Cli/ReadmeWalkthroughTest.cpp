// The README's walkthrough, run as written: the indented lines between its markers,
// as one shell script, with /tmp/demo moved to a scratch directory and the build
// directory of this suite in PATH.
#include <gtest/gtest.h>

#include <sstream>

#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl::test;

namespace {

// The walkthrough's command lines, or none when the markers are missing.
std::vector<std::string> walkthroughLines() {
    std::istringstream readme(readFile(std::string(VESSEL_SOURCE_DIR) + "/README.md"));
    std::vector<std::string> lines;
    bool inside = false;
    for (std::string line; std::getline(readme, line);) {
        if (line.rfind("<!-- walkthrough begin", 0) == 0) inside = true;
        else if (line.rfind("<!-- walkthrough end", 0) == 0) break;
        else if (inside && line.rfind("    ", 0) == 0) lines.push_back(line.substr(4));
    }
    return lines;
}

void replaceAll(std::string* text, const std::string& from, const std::string& to) {
    for (size_t at = 0; (at = text->find(from, at)) != std::string::npos; at += to.size()) text->replace(at, from.size(), to);
}

}  // namespace

TEST(ReadmeWalkthrough, RunsAsWritten) {
    const auto lines = walkthroughLines();
    ASSERT_GE(lines.size(), 10u) << "README.md has no walkthrough between its markers";
    const std::string scratch = makeTempDir("vessel-readme-");
    // A failing line stops the script; whatever it started is stopped and waited for.
    std::string script = "set -e\ntrap 'rc=$?; set +e; kill $(jobs -p) 2>/dev/null; wait; exit $rc' EXIT\n";
    for (std::string line : lines) {
        replaceAll(&line, "/tmp/demo", scratch + "/demo");
        replaceAll(&line, "$PWD/build", std::string(VESSEL_BUILD_DIR));
        script += line + "\n";
    }
    std::string out, err;
    const int status = runProgram({"/usr/bin/timeout", "120", "/bin/sh", "-c", script}, &out, &err,
                                  {"VESSELD_OSLOG=off"});
    removeTree(scratch);
    EXPECT_EQ(0, status) << "script:\n" << script << "\nout:\n" << out << "\nerr:\n" << err;
    for (const char* shown : {"ReplyPath: ", "ReplyInfoValue: blue", "locked\n", "unlocked\n", "Answering: 1",
                              "0 problems"})
        EXPECT_NE(std::string::npos, out.find(shown)) << shown << " in:\n" << out;
}
