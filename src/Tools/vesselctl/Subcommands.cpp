#include "Subcommands.h"

#include <cstdlib>

#include "Client/VSLArguments.h"
#include "Client/VSLProtocol.h"
#include "SubcommandTable.h"
#include "VerbArguments.h"

using namespace vsl;

Dictionary commandRequest(const char* commandName) {
    return {{"Command", Value::uint64(*commandNumberForName(commandName))}};
}

std::optional<Dictionary> namedRequest(const std::string& name, const std::vector<std::string>& words,
                                       std::string* error) {
    auto usage = [&](const char* text) {
        *error = text;
        return Dictionary{};
    };
    Dictionary request;
    if (name == "metadata") {
        request = commandRequest("metadata");
        request["InfoDictRequested"] = Value::boolean(true);
    } else if (name == "recreate-structure") {
        request = commandRequest("recreateDefaultStructure");
    } else if (name == "regenerate-uuid") {
        request = commandRequest("regenerateDirectoryUUID");
    } else if (name == "migrate") {
        request = commandRequest("performDataMigration");
    } else if (name == "migrate-user") {
        request = commandRequest("performPerUserDataMigration");
    } else if (name == "test-lock") {
        auto lock = words.size() == 2 ? parseNumber(words[0]) : std::nullopt;
        if (!lock || (words[1] != "on" && words[1] != "off")) return usage("test-lock N on|off");
        request = commandRequest("setTestLock");
        request["TestLock"] = Value::uint64(*lock);
        request["Enable"] = Value::boolean(words[1] == "on");
        return request;
    } else if (name == "retry-test") {
        auto crashes = words.size() == 1 ? parseNumber(words[0]) : std::nullopt;
        if (!crashes) return usage("retry-test N");
        request = commandRequest("retryTest");
        request["NumRetryCrashes"] = Value::uint64(*crashes);
        return request;
    } else if (auto group = groupRequest(name, words, error)) {
        return group;
    } else {
        return contentRequest(name, words, error);
    }
    if (!words.empty()) *error = name + " [KEY=VALUE...]";
    return request;
}

int runRequestSubcommand(const CtlOptions& options, const SubcommandArgs& args) {
    VerbArguments parsed;
    std::string error;
    if (!parseVerbArguments(args.words, &parsed, &error, /*classOption=*/false))
        return printUsageError(options, args.name + ": " + error);
    auto request = namedRequest(args.name, parsed.positional, &error);
    if (!error.empty() || !request) return printUsageError(options, error.empty() ? args.name : error);
    for (auto& [key, value] : parsed.keys) request->insert_or_assign(key, value);
    return sendAndPrint(options, *request);
}
