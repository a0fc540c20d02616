#include "Verbs.h"

#include "Daemon/Core/VSLContainerClass.h"
#include "Subcommands.h"

using namespace vsl;

namespace {

// Adds the UUID of the request's container; false after printing why there is none.
bool addUUID(const CtlOptions& options, Dictionary& request, int* status) {
    Dictionary lookup = commandRequest("createOrLookup");
    for (const char* key : {"Identifier", "ContainerClass", "PersonaUniqueString"})
        if (auto it = request.find(key); it != request.end()) lookup[key] = it->second;
    lookup["CreateIfNecessary"] = Value::boolean(false);
    auto reply = exchange(options, lookup, status);
    if (!reply) return false;
    const Value* uuid = reply->find("ReplyUUID");
    if (!uuid) {
        *status = printReply(options, *reply);
        return false;
    }
    request["UUID"] = *uuid;
    return true;
}

}  // namespace

int runVerb(const CtlOptions& options, const SubcommandArgs& args,
            const std::function<bool(const VerbArguments&, Dictionary&)>& build, bool needsUUID) {
    VerbArguments parsed;
    std::string error;
    Dictionary request;
    const Subcommand* entry = findSubcommand(args.name);
    const std::string usage = args.name + " " + entry->synopsis;
    if (!parseVerbArguments(args.words, &parsed, &error)) return printUsageError(options, usage + "\n  " + error);
    if (!build(parsed, request)) return printUsageError(options, usage);
    for (auto& [key, value] : parsed.keys) request.insert_or_assign(key, value);
    int status = kExitSuccess;
    if (needsUUID && !request.count("UUID") && !addUUID(options, request, &status)) return status;
    return sendAndPrint(options, request);
}

void setContainer(Dictionary& request, const VerbArguments& parsed, const std::string* identifier) {
    if (identifier) request["Identifier"] = Value::string(*identifier);
    request["ContainerClass"] = Value::uint64(parsed.containerClass.value_or(kVSLClassApplicationData));
}

namespace {

// The verbs that name one container and nothing else: ID as the only word (or Identifier=).
int runOnContainer(const CtlOptions& options, const SubcommandArgs& args, const char* command,
                   const std::function<void(Dictionary&)>& extra = nullptr, bool needsUUID = false) {
    return runVerb(options, args, [&](const VerbArguments& parsed, Dictionary& request) {
        if (parsed.positional.size() > 1) return false;
        if (parsed.positional.empty() && !parsed.keys.count("Identifier")) return false;
        request = commandRequest(command);
        setContainer(request, parsed, parsed.positional.empty() ? nullptr : &parsed.positional[0]);
        if (extra) extra(request);
        return true;
    }, needsUUID);
}

}  // namespace

int runCreate(const CtlOptions& options, const SubcommandArgs& args) {
    return runOnContainer(options, args, "createOrLookup",
                          [](Dictionary& r) { r["CreateIfNecessary"] = Value::boolean(true); });
}

int runLookup(const CtlOptions& options, const SubcommandArgs& args) {
    return runOnContainer(options, args, "createOrLookup",
                          [](Dictionary& r) { r["CreateIfNecessary"] = Value::boolean(false); });
}

int runDelete(const CtlOptions& options, const SubcommandArgs& args) {
    return runOnContainer(options, args, "deleteContainer");
}

int runDiskUsage(const CtlOptions& options, const SubcommandArgs& args) {
    return runOnContainer(options, args, "diskUsage", nullptr, /*needsUUID=*/true);
}

int runList(const CtlOptions& options, const SubcommandArgs& args) {
    return runVerb(options, args, [](const VerbArguments& parsed, Dictionary& request) {
        if (!parsed.positional.empty()) return false;
        request = commandRequest("containersWithClass");
        setContainer(request, parsed, nullptr);
        return true;
    });
}

// A plug-in's data container: the daemon takes the identifier alone unless a class is named.
int runWipe(const CtlOptions& options, const SubcommandArgs& args) {
    return runVerb(options, args, [](const VerbArguments& parsed, Dictionary& request) {
        if (parsed.positional.size() != 1) return false;
        request = commandRequest("wipeContainer");
        request["Identifier"] = Value::string(parsed.positional[0]);
        if (parsed.containerClass) request["ContainerClass"] = Value::uint64(*parsed.containerClass);
        return true;
    });
}
