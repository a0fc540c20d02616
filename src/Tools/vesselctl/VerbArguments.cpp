#include "VerbArguments.h"

#include <strings.h>

#include <cerrno>
#include <cstdlib>

#include "Client/VSLArguments.h"
#include "Daemon/Core/VSLContainerClass.h"

using namespace vsl;

std::optional<uint64_t> parseNumber(const std::string& text) {
    if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos) return std::nullopt;
    errno = 0;
    unsigned long long n = std::strtoull(text.c_str(), nullptr, 10);
    if (errno == ERANGE) return std::nullopt;
    return n;
}

std::optional<uint64_t> containerClassNamed(const std::string& name) {
    if (auto n = parseNumber(name)) {
        if (isValidContainerClass(*n)) return n;
        return std::nullopt;
    }
    // Everyday words for the short names of the table.
    static constexpr std::pair<const char*, const char*> kWords[] = {
        {"data", "appData"}, {"bundle", "app"}, {"group", "appGroup"}, {"system", "systemData"}};
    std::string shortName = name;
    for (const auto& [word, tableName] : kWords)
        if (strcasecmp(word, name.c_str()) == 0) shortName = tableName;
    for (VSLContainerClass c = 1; isValidContainerClass(c); c++)
        if (strcasecmp(containerClassShortName(c), shortName.c_str()) == 0) return c;
    return std::nullopt;
}

std::optional<std::pair<std::string, Value>> parseKeyValue(const std::string& word, std::string* error) {
    const std::string key = word.substr(0, word.find('='));
    if (key.find(':') == std::string::npos && !client::isRequestKey(key)) {
        *error = "unknown key \"" + key + "\" (key:type=value sends it anyway)";
        return std::nullopt;
    }
    return client::parseArgument(word, error);
}

bool parseVerbArguments(const std::vector<std::string>& words, VerbArguments* out, std::string* error,
                        bool classOption) {
    for (size_t i = 0; i < words.size(); i++) {
        const std::string& w = words[i];
        if (classOption && w == "--class") {
            if (i + 1 >= words.size()) {
                *error = "--class needs a class";
                return false;
            }
            out->containerClass = containerClassNamed(words[++i]);
            if (!out->containerClass) {
                *error = "unknown class \"" + words[i] + "\" (a number 1-13 or a short name: data bundle plugin "
                         "pluginData group system systemGroup ...)";
                return false;
            }
        } else if (w.size() > 1 && w[0] == '-' && classOption) {
            *error = "unknown option " + w;
            return false;
        } else if (w.find('=') != std::string::npos && w[0] != '-') {
            auto kv = parseKeyValue(w, error);
            if (!kv) return false;
            out->keys.insert_or_assign(kv->first, kv->second);
        } else {
            out->positional.push_back(w);
        }
    }
    return true;
}
