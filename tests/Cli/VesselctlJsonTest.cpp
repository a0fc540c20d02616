// Every vesselctl subcommand under --json, against a real daemon: the output is one
// JSON object carrying the keys its manual page documents, failures included.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <set>

#include "Cli/ManPage.h"
#include "Platform/PasswordDatabase.h"
#include "Platform/SystemRoot.h"
#include "Support/DaemonProcess.h"
#include "Support/Json.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;
namespace fs = std::filesystem;

namespace {

const char* const kGroup = "systemgroup.com.example.shared";
const std::vector<std::string> kErrorKeys = {"error", "name", "message"};

struct Row {
    std::vector<std::string> args;  // "{NAME}" is replaced by what an earlier row saved
    int exitCode = 0;
    std::vector<std::string> keys;  // beyond the documented ones; kErrorKeys for failures
    const char* save = nullptr;     // saves this string of the output as {save}
    const char* from = "ReplyUUID";
};

Row row(std::vector<std::string> args, int exitCode = 0, std::vector<std::string> keys = {},
        const char* save = nullptr, const char* from = "ReplyUUID") {
    return Row{std::move(args), exitCode, std::move(keys), save, from};
}

std::string substituted(std::string arg, const std::map<std::string, std::string>& saved) {
    for (const auto& [name, value] : saved) {
        const std::string mark = "{" + name + "}";
        for (size_t at; (at = arg.find(mark)) != std::string::npos;) arg.replace(at, mark.size(), value);
    }
    return arg;
}

}  // namespace

TEST(VesselctlJson, EverySubcommandPrintsItsDocumentedKeys) {
    std::map<std::string, std::vector<std::string>> documented;
    for (const auto& s : manPageSubcommands()) documented[s.name] = s.jsonKeys;
    ASSERT_FALSE(documented.empty());

    DaemonProcess daemon;
    const std::string ctl = daemon.addClient(
        "operator", "com.example.operator",
        dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)},
              {"com.tarrow.private.Vesselry.testability", Value::boolean(true)},
              {"com.tarrow.private.Vesselry.stageSharedContent", Value::boolean(true)},
              {"com.tarrow.private.Vesselry.userManagedAssets", Value::boolean(true)},
              {"com.tarrow.security.system-groups", Value::array({Value::string(kGroup)})}}));
    ASSERT_FALSE(ctl.empty());
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    setSystemRoot(daemon.root());
    auto mobile = passwordEntryForName("mobile");
    ASSERT_TRUE(mobile);

    std::map<std::string, std::function<void(const std::string&)>> prepare = {
        // Something to move inside the group container, and an asset to delete.
        {"stage-shared", [](const std::string& group) { fs::create_directories(group + "/in"); }},
        {"assets-delete", [](const std::string& assets) { std::ofstream(assets + "/old") << "x"; }},
    };
    const std::vector<Row> rows = {
        row({"create", "com.example.app"}, 0, {}, "U"),
        row({"lookup", "com.example.app", "--class", "appData"}),
        row({"list", "--class", "data"}),
        row({"info", "set", "com.example.app", "color", "blue"}),
        row({"info", "get", "com.example.app", "color"}, 0, {"ReplyInfoValue"}),
        row({"du", "com.example.app"}),
        row({"groups"}),
        row({"protect", "com.example.app", "3"}),
        row({"metadata", "Identifier=com.example.app", "ContainerClass=2", "UUID={U}"}),
        row({"recreate-structure", "Identifier=com.example.app", "ContainerClass=2", "UUID={U}"}),
        row({"create", "com.example.app", "Transient=true"}, 0, {}, "T"),
        row({"replace", "com.example.app", "{T}", "{U}"}),
        row({"regenerate-uuid", "Identifier=com.example.app", "ContainerClass=2", "UUID={T}"}),
        row({"create", "com.example.widget", "--class", "pluginData"}),
        row({"wipe", "com.example.widget"}),
        row({"wipe-content", "com.example.widget", "4"}),
        row({"group-ids"}),
        row({"system-container", "Identifier=com.example.service"}),
        row({"system-groups"}),
        row({"create", kGroup, "--class", "systemgroup"}, 0, {}, "G", "ReplyPath"),
        row({"system-group", kGroup}),
        row({"stage-shared", kGroup, "in", "out"}),
        row({"assets-path", "com.example.app", "--create"}, 0, {}, "A", "ReplyPath"),
        row({"assets-delete", "com.example.app", "old"}),
        row({"migrate"}),
        row({"migrate-user"}),
        row({"test-lock", "7", "off"}),
        row({"retry-test", "0"}),
        row({"keybag", "state"}),
        row({"upcall", "uid=" + std::to_string(mobile->uid)}),
        row({"status"}, 0, {}),
        row({"doctor"}),
        row({"wait", "com.tarrow.vesseld.cleanup-complete"}),
        row({"personaUniqueStrings"}, 0, {"ReplyError", "ReplyPersonaUniqueStringsArray"}),
        row({"delete", "com.example.app"}),
        // Failures: the error object, and the exit status says which kind.
        row({"lookup", "com.example.app"}, 1, kErrorKeys),
        row({"info", "get", "com.example.missing", "color"}, 1, kErrorKeys),
        row({"create", "com.example.app", "--class", "teapot"}, 2, kErrorKeys),
        row({"frobnicate"}, 2, kErrorKeys),
        row({"wait", "com.tarrow.vesseld.never-posted", "--timeout", "0"}, 1, kErrorKeys),
        row({"--socket", daemon.at("nothing-here"), "create", "com.example.app"}, 3, kErrorKeys),
    };

    std::map<std::string, std::string> saved;
    std::set<std::string> covered;
    for (const auto& row : rows) {
        std::vector<std::string> argv = {ctl, "--root", daemon.root()};
        bool first = true;
        for (const auto& a : row.args) {
            argv.push_back(substituted(a, saved));
            // --json after the subcommand here and there: it is taken anywhere.
            if (first && a.rfind("--", 0) != 0) {
                first = false;
                if (row.args.size() % 2) argv.insert(argv.end() - 1, "--json");
            }
        }
        if (row.args.size() % 2 == 0) argv.push_back("--json");
        const std::string& name = row.args[0].rfind("--", 0) == 0 ? row.args[2] : row.args[0];
        SCOPED_TRACE(name + " " + (row.args.size() > 1 ? row.args[1] : ""));
        if (prepare.count(name)) {
            ASSERT_TRUE(saved.count(name == "stage-shared" ? "G" : "A"));
            prepare[name](saved[name == "stage-shared" ? "G" : "A"]);
        }

        std::string out, err;
        const int status = runProgram(argv, &out, &err);
        EXPECT_EQ(row.exitCode, status) << out << err;
        std::string why;
        auto json = parseJson(out, &why);
        ASSERT_TRUE(json && json->dictionaryValue()) << "not one JSON object (" << why << "): " << out << err;

        std::vector<std::string> keys = row.keys;
        if (row.exitCode == 0 && documented.count(name)) {
            covered.insert(name);
            keys.insert(keys.end(), documented[name].begin(), documented[name].end());
        }
        ASSERT_FALSE(keys.empty()) << "no documented keys";
        for (const auto& key : keys) EXPECT_TRUE(json->find(key)) << "missing \"" << key << "\": " << out;
        if (row.exitCode != 0) {
            EXPECT_TRUE(json->find("error")->int64Value()) << out;
            EXPECT_NE(nullptr, json->find("name")->stringValue()) << out;
        }
        if (row.save) {
            const Value* v = json->find(row.from);
            ASSERT_TRUE(v && v->stringValue()) << out;
            saved[row.save] = *v->stringValue();
        }
    }
    for (const auto& [name, keys] : documented) EXPECT_TRUE(covered.count(name)) << name << " was not run";

    // Strings that JSON must escape come back as they went in.
    const std::string awkward = "com.example.\"quoted\"\\back\tslash\u00fc";
    std::string out, err;
    EXPECT_EQ(0, runProgram({ctl, "--root", daemon.root(), "--json", "create", awkward}, &out, &err)) << err;
    auto json = parseJson(out);
    ASSERT_TRUE(json) << out;
    ASSERT_TRUE(json->find("ReplyIdentifier")) << out;
    EXPECT_EQ(awkward, *json->find("ReplyIdentifier")->stringValue());
    EXPECT_EQ(0, daemon.stop());
}
