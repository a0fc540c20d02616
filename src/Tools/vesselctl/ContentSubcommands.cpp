#include "ContentSubcommands.h"

#include <cstdlib>
#include <vector>

#include "Client/VSLProtocol.h"

using namespace vsl;

const char* const kContentSubcommandUsage =
    "  wipe ID | wipe-content ID CLASS | stage-shared GROUP SRC DEST\n"
    "  assets-path [ID] [--relative] [--create] | assets-delete ID PATH\n";

namespace {

Dictionary command(const char* name) {
    return {{"Command", Value::uint64(*commandNumberForName(name))}};
}

}  // namespace

std::optional<Dictionary> contentSubcommandRequest(int argc, char** argv, int* index, std::string* error) {
    const int i = *index;
    const std::string word = argv[i];
    // The words after the subcommand, up to the first key=value argument.
    std::vector<std::string> words;
    for (int j = i + 1; j < argc && std::string(argv[j]).find('=') == std::string::npos; j++) words.push_back(argv[j]);
    auto usage = [&](const char* text) {
        *error = std::string("usage: vesselctl ") + text;
        return Dictionary{};
    };
    Dictionary request;
    if (word == "wipe") {
        if (words.size() != 1) return usage("wipe ID");
        request = command("wipeContainer");
        request["Identifier"] = Value::string(words[0]);
    } else if (word == "wipe-content") {
        char* end = nullptr;
        unsigned long long c = words.size() == 2 ? std::strtoull(words[1].c_str(), &end, 10) : 0;
        if (words.size() != 2 || words[1].empty() || *end) return usage("wipe-content ID CLASS");
        request = command("deleteContainerContent");
        request["Identifier"] = Value::string(words[0]);
        request["ContainerClass"] = Value::uint64(c);
    } else if (word == "stage-shared") {
        if (words.size() != 3) return usage("stage-shared GROUP SRC DEST");
        request = command("stageSharedContent");
        request["Identifier"] = Value::string(words[0]);
        request["SourcePath"] = Value::string(words[1]);
        request["DestPath"] = Value::string(words[2]);
    } else if (word == "assets-path") {
        request = command("userManagedAssetsPath");
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
    } else if (word == "assets-delete") {
        if (words.size() != 2) return usage("assets-delete ID PATH");
        request = command("deleteUserManagedAsset");
        request["Identifier"] = Value::string(words[0]);
        request["SourcePath"] = Value::string(words[1]);
    } else {
        return std::nullopt;
    }
    *index = i + 1 + static_cast<int>(words.size());
    return request;
}
