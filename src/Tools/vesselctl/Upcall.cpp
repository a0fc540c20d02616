#include "Upcall.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <optional>

#include "Client/VSLArguments.h"
#include "Client/VSLUpcallClient.h"

using namespace vsl;
using namespace vsl::client;

const char* const kUpcallUsage =
    "  upcall uid=N [container-id=ID] [signature-id=ID] [application-id=ID] [type=0|1]\n"
    "         [group=ID]... [system-container=ID] [system-group=ID]... [persona=N]\n"
    "                                 asks the kernel upcall channel for a process's containers\n";

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

int runUpcallSubcommand(const std::string& socketPath, bool asJson, long timeoutSeconds, int argc, char** argv,
                        int index) {
    VSLUpcallQuery query;
    std::string error;
    for (int i = index; i < argc; i++) {
        if (!addWord(argv[i], &query, &error)) {
            std::fprintf(stderr, "vesselctl: %s\n", error.c_str());
            return 2;
        }
    }
    if (!query.uid) {
        std::fprintf(stderr, "vesselctl: upcall needs uid=N\n");
        return 2;
    }
    if (!query.personaID) query.personaID = 0xFFFFFFFF;
    auto packbuff = packUpcallQuery(query);
    if (!packbuff) {
        std::fprintf(stderr, "vesselctl: the request cannot be packed\n");
        return 2;
    }
    auto client = VSLUpcallClient::connect(socketPath, &error);
    if (!client) {
        std::fprintf(stderr, "vesselctl: cannot reach the kernel upcall channel: %s\n", error.c_str());
        return 3;
    }
    UpcallReplyFrame frame;
    const auto status =
        client->getProcessContainers(*packbuff, &frame, std::chrono::milliseconds(timeoutSeconds * 1000), &error);
    if (status != VSLUpcallStatus::Ok) {
        std::fprintf(stderr, "vesselctl: upcall failed (%s): %s\n", upcallStatusName(status), error.c_str());
        return 3;
    }
    Dictionary out{{"ReturnCode", Value::int64(frame.returnCode)}};
    bool complete = false;
    if (frame.returnCode == 0) {
        auto containers = unpackUpcallReply(frame.packbuff, &error);
        if (!containers) {
            std::fprintf(stderr, "vesselctl: unreadable reply: %s\n", error.c_str());
            return 3;
        }
        complete = containers->status == 1u;
        const Value items = containers->value();
        for (const auto& [key, value] : *items.dictionaryValue()) out.insert_or_assign(key, value);
    }
    const Value reply = Value::dictionary(std::move(out));
    if (asJson) {
        std::printf("%s\n", renderJson(reply).c_str());
    } else {
        std::printf("%s", renderHuman(reply).c_str());
    }
    return complete ? 0 : 1;
}
