#include "Client/VSLArguments.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <map>

#include "Platform/PropertyList.h"

namespace vsl::client {

namespace {

const std::map<std::string, std::string>& knownKeyTypes() {
    static const std::map<std::string, std::string> types = {
        {"Command", "u64"}, {"ContainerClass", "u64"}, {"OldContainerClass", "u64"},
        {"NewContainerClass", "u64"}, {"NumRetryCrashes", "u64"}, {"TestLock", "u64"},
        {"DataProtectionClass", "i64"},
        {"CreateIfNecessary", "bool"}, {"Transient", "bool"}, {"InfoDictRequested", "bool"},
        {"IsThirdParty", "bool"}, {"RetryIfLocked", "bool"}, {"IsRelative", "bool"}, {"Enable", "bool"},
        {"UUID", "uuid"}, {"OldContainerUUID", "uuid"}, {"NewContainerUUID", "uuid"},
        {"ContainerClassesArray", "u64s"}, {"UUIDsArray", "uuids"}, {"IdentifiersArray", "strs"},
        {"PersonaUniqueStringsArray", "strs"},
        {"CodeSigningInfo", "plist"}, {"OptionsDictionary", "plist"},
    };
    return types;
}

// Request keys of any value type, typed only by what they are given.
bool isUntypedRequestKey(const std::string& key) {
    static const char* const keys[] = {"Identifier",       "PersonaUniqueString", "Key",
                                       "Value",            "GroupIdentifier",     "SourcePath",
                                       "DestPath",         "OldIdentifier",       "NewIdentifier",
                                       "OldPersonaUniqueString", "NewPersonaUniqueString"};
    for (const char* k : keys)
        if (key == k) return true;
    return false;
}

std::optional<uint64_t> parseU64(const std::string& s) {
    if (s.empty() || s[0] == '-') return std::nullopt;
    errno = 0;
    char* end = nullptr;
    unsigned long long v = std::strtoull(s.c_str(), &end, 0);
    if (errno || *end) return std::nullopt;
    return v;
}

std::optional<int64_t> parseI64(const std::string& s) {
    errno = 0;
    char* end = nullptr;
    long long v = std::strtoll(s.c_str(), &end, 0);
    if (s.empty() || errno || *end) return std::nullopt;
    return v;
}

std::vector<std::string> splitCommas(const std::string& s) {
    std::vector<std::string> out;
    if (s.empty()) return out;
    size_t start = 0;
    for (;;) {
        size_t comma = s.find(',', start);
        out.push_back(s.substr(start, comma - start));
        if (comma == std::string::npos) return out;
        start = comma + 1;
    }
}

std::optional<Value> parseTyped(const std::string& type, const std::string& text, std::string* error) {
    auto bad = [&]() -> std::optional<Value> {
        *error = "not a valid " + type + ": \"" + text + "\"";
        return std::nullopt;
    };
    if (type == "str") return Value::string(text);
    if (type == "null") return Value();
    if (type == "u64") {
        auto v = parseU64(text);
        return v ? std::optional<Value>(Value::uint64(*v)) : bad();
    }
    if (type == "i64") {
        auto v = parseI64(text);
        return v ? std::optional<Value>(Value::int64(*v)) : bad();
    }
    if (type == "bool") {
        if (text == "true" || text == "1" || text == "yes") return Value::boolean(true);
        if (text == "false" || text == "0" || text == "no") return Value::boolean(false);
        return bad();
    }
    if (type == "uuid") {
        auto u = Uuid::parse(text);
        return u ? std::optional<Value>(Value::uuid(*u)) : bad();
    }
    if (type == "u64s" || type == "strs" || type == "uuids") {
        Array items;
        for (const auto& part : splitCommas(text)) {
            auto item = parseTyped(type.substr(0, type.size() - 1), part, error);
            if (!item) return std::nullopt;
            items.push_back(*item);
        }
        return Value::array(std::move(items));
    }
    if (type == "plist") {
        if (text.empty() || text[0] != '@') {
            *error = "a plist value is read from a file: key:plist=@FILE";
            return std::nullopt;
        }
        std::ifstream in(text.substr(1), std::ios::binary);
        std::string bytes((std::istreambuf_iterator<char>(in)), {});
        std::string why;
        auto v = decodePropertyList(bytes.data(), bytes.size(), &why);
        if (!v) {
            *error = text.substr(1) + ": " + why;
            return std::nullopt;
        }
        return v;
    }
    *error = "unknown type \"" + type + "\" (str, u64, i64, bool, uuid, null, plist, u64s, strs, uuids)";
    return std::nullopt;
}

}  // namespace

bool isRequestKey(const std::string& key) { return knownKeyTypes().count(key) || isUntypedRequestKey(key); }

std::optional<std::pair<std::string, Value>> parseArgument(const std::string& text, std::string* error) {
    size_t eq = text.find('=');
    if (eq == std::string::npos || eq == 0) {
        *error = "expected key=value, got \"" + text + "\"";
        return std::nullopt;
    }
    std::string key = text.substr(0, eq);
    std::string value = text.substr(eq + 1);
    std::string type;
    if (size_t colon = key.find(':'); colon != std::string::npos) {
        type = key.substr(colon + 1);
        key = key.substr(0, colon);
    } else if (auto it = knownKeyTypes().find(key); it != knownKeyTypes().end()) {
        type = it->second;
    } else {
        type = (value == "true" || value == "false") ? "bool" : parseU64(value) ? "u64" : "str";
    }
    auto v = parseTyped(type, value, error);
    if (!v) {
        *error = key + ": " + *error;
        return std::nullopt;
    }
    return std::make_pair(key, *v);
}

namespace {

void appendJsonString(std::string& out, const std::string& s) {
    out += '"';
    for (unsigned char c : s) {
        switch (c) {
            case '"': out += "\\\""; break;
            case '\\': out += "\\\\"; break;
            case '\n': out += "\\n"; break;
            case '\t': out += "\\t"; break;
            case '\r': out += "\\r"; break;
            default:
                if (c < 0x20) {
                    char buf[8];
                    std::snprintf(buf, sizeof buf, "\\u%04x", c);
                    out += buf;
                } else {
                    out += static_cast<char>(c);
                }
        }
    }
    out += '"';
}

void json(const Value& v, std::string& out) {
    switch (v.type()) {
        case Value::Type::Null: out += "null"; break;
        case Value::Type::Bool: out += *v.boolValue() ? "true" : "false"; break;
        case Value::Type::UInt64: out += std::to_string(*v.uint64Value()); break;
        case Value::Type::Int64: out += std::to_string(*v.int64Value()); break;
        case Value::Type::Double: {
            char buf[64];
            std::snprintf(buf, sizeof buf, "%.17g", *v.doubleValue());
            out += buf;
            break;
        }
        case Value::Type::String: appendJsonString(out, *v.stringValue()); break;
        case Value::Type::Uuid: appendJsonString(out, v.uuidValue()->string()); break;
        case Value::Type::Data:
        case Value::Type::Date: appendJsonString(out, v.description()); break;
        case Value::Type::Array: {
            out += '[';
            bool first = true;
            for (const auto& item : *v.arrayValue()) {
                if (!first) out += ',';
                first = false;
                json(item, out);
            }
            out += ']';
            break;
        }
        case Value::Type::Dictionary: {
            out += '{';
            bool first = true;
            for (const auto& [k, item] : *v.dictionaryValue()) {
                if (!first) out += ',';
                first = false;
                appendJsonString(out, k);
                out += ':';
                json(item, out);
            }
            out += '}';
            break;
        }
    }
}

}  // namespace

std::string renderJson(const Value& value) {
    std::string out;
    json(value, out);
    return out;
}

std::string renderHuman(const Value& reply) {
    std::string out;
    const Dictionary* d = reply.dictionaryValue();
    if (!d) return reply.description() + "\n";
    // The result first, then the reply keys in name order.
    if (auto it = d->find("ReplyError"); it != d->end()) out += "ReplyError: " + it->second.description() + "\n";
    for (const auto& [k, v] : *d) {
        if (k == "ReplyError") continue;
        out += k + ": " + v.description() + "\n";
    }
    return out;
}

}  // namespace vsl::client
