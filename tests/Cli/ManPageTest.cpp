// The manual page documents exactly the subcommands vesselctl has, each with its
// JSON keys, and what it says about usage errors holds.
#include <gtest/gtest.h>

#include "Cli/ManPage.h"
#include "Support/DaemonProcess.h"

using namespace vsl::test;

TEST(VesselctlManPage, ListsTheSubcommandsOfHelpInOrderEachWithItsJsonKeys) {
    std::vector<std::string> documented;
    for (const auto& s : manPageSubcommands()) {
        documented.push_back(s.name);
        EXPECT_FALSE(s.jsonKeys.empty()) << s.name << " documents no JSON keys";
    }
    const std::vector<std::string> help = helpSubcommands();
    ASSERT_GT(help.size(), 10u) << "vesselctl --help lists its subcommands";
    EXPECT_EQ(help, documented) << "docs/man/vesselctl.1.md and vesselctl --help disagree";
}

TEST(VesselctlManPage, UnknownSubcommandOptionOrKeyPrintsUsageAndExitsTwo) {
    struct Case {
        std::vector<std::string> args;
        const char* what;
    } cases[] = {
        {{"frobnicate"}, "unknown subcommand"},
        {{"create", "com.example.app", "--colour", "red"}, "unknown option of a verb"},
        {{"create", "com.example.app", "Colour=red"}, "unknown key"},
        {{"createOrLookup", "Identifer=com.example.app"}, "unknown key of a raw command"},
        {{"create", "com.example.app", "--class", "teapot"}, "unknown class"},
        {{"info", "peek", "com.example.app", "k"}, "unknown info verb"},
        {{"--frobnicate", "status"}, "unknown global option"},
        {{"create"}, "missing identifier"},
        {{"keybag", "open"}, "unknown keybag verb"},
        {{"status", "extra"}, "extra word"},
    };
    for (const auto& c : cases) {
        std::vector<std::string> argv = {vesselctlPath(), "--root", "/nonexistent-vessel-root"};
        argv.insert(argv.end(), c.args.begin(), c.args.end());
        std::string out, err;
        EXPECT_EQ(2, runProgram(argv, &out, &err)) << c.what << ": " << out << err;
        EXPECT_NE(std::string::npos, err.find("usage: vesselctl")) << c.what << ": " << err;
    }
}
