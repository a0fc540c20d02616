#include "Platform/PropertyList.h"

#include <plist/plist.h>

#include <cstdlib>
#include <cstring>
#include <limits>

namespace vsl {

namespace {

// Seconds between 1970-01-01 and the property-list epoch 2001-01-01.
constexpr int64_t kPlistEpochOffset = 978307200;

struct PlistFree {
    void operator()(void* p) const { plist_free(static_cast<plist_t>(p)); }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

plist_t toPlist(const Value& v, std::string* error) {
    switch (v.type()) {
        case Value::Type::Null:
            if (error) *error = "null cannot be stored in a property list";
            return nullptr;
        case Value::Type::Bool: return plist_new_bool(*v.boolValue());
        case Value::Type::UInt64: return plist_new_uint(*v.uint64Value());
        case Value::Type::Int64: return plist_new_uint(static_cast<uint64_t>(*v.int64Value()));
        case Value::Type::Double: return plist_new_real(*v.doubleValue());
        case Value::Type::String: return plist_new_string(v.stringValue()->c_str());
        case Value::Type::Data: {
            const auto& d = *v.dataValue();
            return plist_new_data(reinterpret_cast<const char*>(d.data()), d.size());
        }
        case Value::Type::Uuid: {
            auto u = *v.uuidValue();
            return plist_new_data(reinterpret_cast<const char*>(u.bytes.data()), 16);
        }
        case Value::Type::Date: {
            int64_t ns = v.dateValue()->nanoseconds;
            int64_t secs = ns / 1000000000;
            int64_t rem = ns % 1000000000;
            if (rem < 0) {
                rem += 1000000000;
                secs -= 1;
            }
            int64_t rel = secs - kPlistEpochOffset;
            if (rel < std::numeric_limits<int32_t>::min() || rel > std::numeric_limits<int32_t>::max()) {
                if (error) *error = "date out of range for a property list";
                return nullptr;
            }
            return plist_new_date(static_cast<int32_t>(rel), static_cast<int32_t>(rem / 1000));
        }
        case Value::Type::Array: {
            PlistPtr a(plist_new_array());
            for (const auto& item : *v.arrayValue()) {
                plist_t p = toPlist(item, error);
                if (!p) return nullptr;
                plist_array_append_item(a.get(), p);
            }
            return a.release();
        }
        case Value::Type::Dictionary: {
            PlistPtr d(plist_new_dict());
            for (const auto& [k, item] : *v.dictionaryValue()) {
                if (k.find('\0') != std::string::npos) {
                    if (error) *error = "dictionary key holds a NUL";
                    return nullptr;
                }
                plist_t p = toPlist(item, error);
                if (!p) return nullptr;
                plist_dict_set_item(d.get(), k.c_str(), p);
            }
            return d.release();
        }
    }
    return nullptr;
}

constexpr int kMaxDepth = 128;

std::optional<Value> fromPlist(plist_t p, int depth, std::string* error) {
    if (depth > kMaxDepth) {
        if (error) *error = "property list nested too deeply";
        return std::nullopt;
    }
    switch (plist_get_node_type(p)) {
        case PLIST_BOOLEAN: {
            uint8_t b = 0;
            plist_get_bool_val(p, &b);
            return Value::boolean(b != 0);
        }
        case PLIST_UINT: {
            uint64_t u = 0;
            plist_get_uint_val(p, &u);
            if (u > static_cast<uint64_t>(std::numeric_limits<int64_t>::max()))
                return Value::int64(static_cast<int64_t>(u));
            return Value::uint64(u);
        }
        case PLIST_UID: {
            uint64_t u = 0;
            plist_get_uid_val(p, &u);
            return Value::uint64(u);
        }
        case PLIST_REAL: {
            double d = 0;
            plist_get_real_val(p, &d);
            return Value::real(d);
        }
        case PLIST_STRING:
        case PLIST_KEY: {
            char* s = nullptr;
            plist_get_string_val(p, &s);
            std::string str = s ? s : "";
            std::free(s);
            return Value::string(std::move(str));
        }
        case PLIST_DATA: {
            char* d = nullptr;
            uint64_t n = 0;
            plist_get_data_val(p, &d, &n);
            Data data(reinterpret_cast<uint8_t*>(d), reinterpret_cast<uint8_t*>(d) + (d ? n : 0));
            std::free(d);
            return Value::data(std::move(data));
        }
        case PLIST_DATE: {
            int32_t sec = 0, usec = 0;
            plist_get_date_val(p, &sec, &usec);
            return Value::date(Date{(static_cast<int64_t>(sec) + kPlistEpochOffset) * 1000000000 +
                                    static_cast<int64_t>(usec) * 1000});
        }
        case PLIST_ARRAY: {
            Array a;
            uint32_t n = plist_array_get_size(p);
            a.reserve(n);
            for (uint32_t i = 0; i < n; i++) {
                auto item = fromPlist(plist_array_get_item(p, i), depth + 1, error);
                if (!item) return std::nullopt;
                a.push_back(std::move(*item));
            }
            return Value::array(std::move(a));
        }
        case PLIST_DICT: {
            Dictionary d;
            plist_dict_iter it = nullptr;
            plist_dict_new_iter(p, &it);
            for (;;) {
                char* key = nullptr;
                plist_t item = nullptr;
                plist_dict_next_item(p, it, &key, &item);
                if (!item) {
                    std::free(key);
                    break;
                }
                auto v = fromPlist(item, depth + 1, error);
                std::string k = key ? key : "";
                std::free(key);
                if (!v) {
                    std::free(it);
                    return std::nullopt;
                }
                d.insert_or_assign(std::move(k), std::move(*v));
            }
            std::free(it);
            return Value::dictionary(std::move(d));
        }
        default:
            if (error) *error = "unsupported property-list node";
            return std::nullopt;
    }
}

}  // namespace

std::optional<std::string> encodeBinaryPropertyList(const Value& root, std::string* error) {
    PlistPtr p(toPlist(root, error));
    if (!p) return std::nullopt;
    char* bytes = nullptr;
    uint32_t length = 0;
    plist_to_bin(p.get(), &bytes, &length);
    if (!bytes) {
        if (error) *error = "property-list serialisation failed";
        return std::nullopt;
    }
    std::string out(bytes, length);
    plist_to_bin_free(bytes);
    return out;
}

std::optional<Value> decodePropertyList(const void* bytes, size_t length, std::string* error) {
    if (length == 0 || length > std::numeric_limits<uint32_t>::max()) {
        if (error) *error = length == 0 ? "empty property list" : "property list too large";
        return std::nullopt;
    }
    plist_t raw = nullptr;
    plist_from_memory(static_cast<const char*>(bytes), static_cast<uint32_t>(length), &raw);
    if (!raw) {
        if (error) *error = "not a property list";
        return std::nullopt;
    }
    PlistPtr p(raw);
    return fromPlist(p.get(), 0, error);
}

}  // namespace vsl
