// `vesselctl upcall`: asks the kernel upcall channel for a process's containers, as
// the kernel would, and prints the reply items.
//   upcall uid=N [container-id=ID] [signature-id=ID] [application-id=ID] [type=0|1]
//          [group=ID]... [system-container=ID] [system-group=ID]... [persona=N]
// Exit status: 0 for return code 0 with status 1, 1 for any other answer.

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <optional>

#include "Client/VSLArguments.h"
#include "Client/VSLUpcallClient.h"
#include "SubcommandTable.h"

using namespace vsl;
using namespace vsl::client;

namespace {

std::optional<uint32_t> number(const std::string& text) {
    if (text.empty()) return std::nullopt;
    char* end = nullptr;
    errno = 0;
    const unsigned long long n = std::strtoull(text.c_str(), &end, 0);
    if (*end || errno != 0 || n > 0xFFFFFFFFull || text[0] == '-') return std::nullopt;
    return static_cast<uint32_t>(n);
}

// False with a message for a word that is not one of the keys.
bool addWord(const std::string& word, VSLUpcallQuery* query, std::string* error) {
    const size_t eq = word.find('=');
    if (eq == std::string::npos) {
        *error = "expected key=value, got \"" + word + "\"";
        return false;
    }
    const std::string key = word.substr(0, eq);
    const std::string value = word.substr(eq + 1);
    auto numberInto = [&](std::optional<uint32_t>* into) {
        *into = number(value);
        if (!*into) *error = key + " wants a number from 0 to 4294967295";
        return into->has_value();
    };
    if (key == "uid") return numberInto(&query->uid);
    if (key == "type") return numberInto(&query->containerType);
    if (key == "persona") return numberInto(&query->personaID);
    if (key == "container-id") query->containerID = value;
    else if (key == "signature-id") query->codeSignatureID = value;
    else if (key == "application-id") query->applicationID = value;
    else if (key == "system-container") query->systemContainerID = value;
    else if (key == "group") query->appGroupIDs.push_back(value);
    else if (key == "system-group") query->systemGroupIDs.push_back(value);
    else {
        *error = "unknown upcall key \"" + key + "\"";
        return false;
    }
    return true;
}

}  // namespace

int runUpcall(const CtlOptions& options, const SubcommandArgs& args) {
    const std::string socketPath =
        options.socketPath.empty() ? VSLUpcallClient::socketPathForSystemRoot(options.root) : options.socketPath;
    VSLUpcallQuery query;
    std::string error;
    for (const auto& word : args.words) {
        if (!addWord(word.c_str(), &query, &error)) return printUsageError(options, "upcall uid=N ...\n  " + error);
    }
    if (!query.uid) return printUsageError(options, "upcall uid=N ...\n  upcall needs uid=N");
    if (!query.personaID) query.personaID = 0xFFFFFFFF;
    auto packbuff = packUpcallQuery(query);
    if (!packbuff) return printUsageError(options, "upcall uid=N ...\n  the request cannot be packed");
    auto client = VSLUpcallClient::connect(socketPath, &error);
    if (!client)
        return printFailure(options, kExitUnreachable, 0, "Unreachable",
                            "cannot reach the kernel upcall channel: " + error);
    UpcallReplyFrame frame;
    const auto status = client->getProcessContainers(
        *packbuff, &frame, std::chrono::milliseconds(options.timeoutSeconds * 1000), &error);
    if (status != VSLUpcallStatus::Ok)
        return printFailure(options, kExitUnreachable, 0, upcallStatusName(status), "upcall failed: " + error);
    Dictionary out{{"ReturnCode", Value::int64(frame.returnCode)}};
    bool complete = false;
    if (frame.returnCode == 0) {
        auto containers = unpackUpcallReply(frame.packbuff, &error);
        if (!containers) return printFailure(options, kExitUnreachable, 0, "BadReply", "unreadable reply: " + error);
        complete = containers->status == 1u;
        const Value items = containers->value();
        for (const auto& [key, value] : *items.dictionaryValue()) out.insert_or_assign(key, value);
    }
    const Value reply = Value::dictionary(std::move(out));
    if (options.json) {
        std::printf("%s\n", renderJson(reply).c_str());
    } else {
        std::printf("%s", renderHuman(reply).c_str());
    }
    return complete ? 0 : 1;
}
