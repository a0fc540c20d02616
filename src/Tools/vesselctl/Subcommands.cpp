#include "Subcommands.h"

#include "ContentSubcommands.h"

#include "Client/VSLProtocol.h"

#include <cstdlib>
#include <cstring>


using namespace vsl;

const char* const kSubcommandUsage =
    "  info get KEY | info set KEY [Value[:type]=V]   (with Identifier= ContainerClass= UUID=)\n"
    "  metadata | recreate-structure | regenerate-uuid | du   (with the same keys)\n"
    "  test-lock N on|off | retry-test N\n"
    "  migrate | migrate-user   (data migration; per-user migration)\n"
    "  protect CLASS   (with Identifier= [ContainerClass=2] [RetryIfLocked=true] [IsThirdParty=true])\n"
    "  keybag lock|unlock|state   (the device lock state of the root; no daemon needed)\n";

namespace {

std::optional<uint64_t> number(const char* text) {
    char* end = nullptr;
    unsigned long long n = std::strtoull(text, &end, 10);
    if (!*text || *end) return std::nullopt;
    return n;
}

Dictionary command(uint64_t number) { return {{"Command", Value::uint64(number)}}; }

}  // namespace

std::optional<Dictionary> subcommandRequest(int argc, char** argv, int* index, std::string* error) {
    if (auto group = groupSubcommandRequest(argc, argv, index, error)) return group;
    const int i = *index;
    const std::string word = argv[i];
    auto need = [&](int words, const char* usage) {
        if (i + words < argc) return true;
        *error = std::string("usage: vesselctl ") + usage;
        return false;
    };
    Dictionary request;
    if (word == "info") {
        if (!need(2, "info get|set KEY ...")) return Dictionary{};
        std::string verb = argv[i + 1];
        if (verb != "get" && verb != "set") {
            *error = "usage: vesselctl info get|set KEY ...";
            return Dictionary{};
        }
        request = command(verb == "get" ? 6 : 5);
        request["Key"] = Value::string(argv[i + 2]);
        *index = i + 3;
        return request;
    }
    if (word == "metadata") {
        request = command(7);
        request["InfoDictRequested"] = Value::boolean(true);
    } else if (word == "recreate-structure") {
        request = command(8);
    } else if (word == "regenerate-uuid") {
        request = command(9);
    } else if (word == "du") {
        request = command(23);
    } else if (word == "migrate") {
        request = command(*commandNumberForName("performDataMigration"));
    } else if (word == "migrate-user") {
        request = command(*commandNumberForName("performPerUserDataMigration"));
    } else if (word == "test-lock") {
        if (!need(2, "test-lock N on|off")) return Dictionary{};
        auto lock = number(argv[i + 1]);
        std::string state = argv[i + 2];
        if (!lock || (state != "on" && state != "off")) {
            *error = "usage: vesselctl test-lock N on|off";
            return Dictionary{};
        }
        request = command(31);
        request["TestLock"] = Value::uint64(*lock);
        request["Enable"] = Value::boolean(state == "on");
        *index = i + 3;
        return request;
    } else if (word == "protect") {
        char* end = nullptr;
        long long cls = i + 1 < argc ? std::strtoll(argv[i + 1], &end, 10) : 0;
        if (i + 1 >= argc || !*argv[i + 1] || *end) {
            *error = "usage: vesselctl protect CLASS Identifier=ID [ContainerClass=N] [RetryIfLocked=true]";
            return Dictionary{};
        }
        request = command(21);
        request["ContainerClass"] = Value::uint64(2);
        request["DataProtectionClass"] = Value::int64(cls);
        *index = i + 2;
        return request;
    } else if (word == "retry-test") {
        auto crashes = i + 1 < argc ? number(argv[i + 1]) : std::nullopt;
        if (!crashes) {
            *error = "usage: vesselctl retry-test N";
            return Dictionary{};
        }
        request = command(25);
        request["NumRetryCrashes"] = Value::uint64(*crashes);
        *index = i + 2;
        return request;
    } else {
        return contentSubcommandRequest(argc, argv, index, error);
    }
    *index = i + 1;
    return request;
}
