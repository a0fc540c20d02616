// The verbs with more than an identifier: info, protect, groups, replace.
#include "Client/VSLArguments.h"
#include "Daemon/Core/VSLContainerClass.h"
#include "Subcommands.h"
#include "Verbs.h"

using namespace vsl;

// info get [ID] KEY; info set [ID] KEY [VALUE] (Value:type=V for a typed value; no
// value removes the key). Without ID the container comes from Identifier=.
int runInfo(const CtlOptions& options, const SubcommandArgs& args) {
    return runVerb(options, args, [](const VerbArguments& parsed, Dictionary& request) {
        const auto& w = parsed.positional;
        if (w.empty() || (w[0] != "get" && w[0] != "set")) return false;
        const bool set = w[0] == "set";
        if (w.size() < 2 || w.size() > (set ? 4u : 3u)) return false;
        const std::string* identifier = w.size() >= 3 ? &w[1] : nullptr;
        request = commandRequest(set ? "setInfoValue" : "infoValueForKey");
        setContainer(request, parsed, identifier);
        request["Key"] = Value::string(identifier ? w[2] : w[1]);
        if (w.size() == 4) request["Value"] = Value::string(w[3]);
        return true;
    }, /*needsUUID=*/true);
}

// protect [ID] PROTECTION-CLASS.
int runProtect(const CtlOptions& options, const SubcommandArgs& args) {
    return runVerb(options, args, [](const VerbArguments& parsed, Dictionary& request) {
        const auto& w = parsed.positional;
        if (w.empty() || w.size() > 2) return false;
        const std::string& text = w.back();
        char* end = nullptr;
        long long protection = std::strtoll(text.c_str(), &end, 10);
        if (text.empty() || *end) return false;
        request = commandRequest("setDataProtection");
        setContainer(request, parsed, w.size() == 2 ? &w[0] : nullptr);
        request["DataProtectionClass"] = Value::int64(protection);
        return true;
    });
}

// groups [OWNER]: the caller's own without one.
int runGroups(const CtlOptions& options, const SubcommandArgs& args) {
    return runVerb(options, args, [](const VerbArguments& parsed, Dictionary& request) {
        if (parsed.positional.size() > 1) return false;
        request = commandRequest("createOrLookupGroupContainers");
        if (!parsed.positional.empty()) request["Identifier"] = Value::string(parsed.positional[0]);
        return true;
    });
}

// replace ID NEW-UUID [OLD-UUID]: the container with NEW-UUID takes the place of the
// one with OLD-UUID, or becomes permanent when there is none. The raw form names
// every Old.../New... key itself.
int runReplace(const CtlOptions& options, const SubcommandArgs& args) {
    return runVerb(options, args, [](const VerbArguments& parsed, Dictionary& request) {
        const auto& w = parsed.positional;
        request = commandRequest("replaceContainer");
        if (w.empty()) return !parsed.keys.empty() && !parsed.containerClass;
        if (w.size() < 2 || w.size() > 3) return false;
        const uint64_t cls = parsed.containerClass.value_or(kVSLClassApplicationData);
        std::string error;
        for (size_t i = 1; i < w.size(); i++) {
            auto uuid = client::parseArgument((i == 1 ? "NewContainerUUID=" : "OldContainerUUID=") + w[i], &error);
            if (!uuid) return false;
            const char* side = i == 1 ? "New" : "Old";
            request[std::string(side) + "Identifier"] = Value::string(w[0]);
            request[std::string(side) + "ContainerClass"] = Value::uint64(cls);
            request.insert_or_assign(uuid->first, uuid->second);
        }
        return true;
    });
}
