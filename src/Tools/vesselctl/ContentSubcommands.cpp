// The subcommands for the content of containers:
//   wipe-content ID CLASS          deleteContainerContent
//   stage-shared GROUP SRC DEST    stageSharedContent (paths relative to the container)
//   assets-path [ID] [--relative] [--create]   userManagedAssetsPath
//   assets-delete ID PATH          deleteUserManagedAsset (PATH relative to the assets directory)
#include "Subcommands.h"
#include "VerbArguments.h"

using namespace vsl;

std::optional<Dictionary> contentRequest(const std::string& name, const std::vector<std::string>& words,
                                         std::string* error) {
    auto usage = [&](const char* text) {
        *error = text;
        return Dictionary{};
    };
    Dictionary request;
    if (name == "wipe-content") {
        auto c = words.size() == 2 ? parseNumber(words[1]) : std::nullopt;
        if (!c) return usage("wipe-content ID CLASS");
        request = commandRequest("deleteContainerContent");
        request["Identifier"] = Value::string(words[0]);
        request["ContainerClass"] = Value::uint64(*c);
    } else if (name == "stage-shared") {
        if (words.size() != 3) return usage("stage-shared GROUP SRC DEST");
        request = commandRequest("stageSharedContent");
        request["Identifier"] = Value::string(words[0]);
        request["SourcePath"] = Value::string(words[1]);
        request["DestPath"] = Value::string(words[2]);
    } else if (name == "assets-path") {
        request = commandRequest("userManagedAssetsPath");
        request["IsRelative"] = Value::boolean(false);
        request["CreateIfNecessary"] = Value::boolean(false);
        for (const auto& w : words) {
            if (w == "--relative")
                request["IsRelative"] = Value::boolean(true);
            else if (w == "--create")
                request["CreateIfNecessary"] = Value::boolean(true);
            else if (!w.empty() && w[0] != '-' && !request.count("Identifier"))
                request["Identifier"] = Value::string(w);
            else
                return usage("assets-path [ID] [--relative] [--create]");
        }
    } else if (name == "assets-delete") {
        if (words.size() != 2) return usage("assets-delete ID PATH");
        request = commandRequest("deleteUserManagedAsset");
        request["Identifier"] = Value::string(words[0]);
        request["SourcePath"] = Value::string(words[1]);
    } else {
        return std::nullopt;
    }
    return request;
}
