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

// UTF-8 without NUL: what a string of the platform can hold.
bool validText(const std::string& s) {
    size_t i = 0;
    while (i < s.size()) {
        unsigned char c = static_cast<unsigned char>(s[i]);
        if (c == 0) return false;
        int n = c < 0x80 ? 0 : (c >> 5) == 6 ? 1 : (c >> 4) == 14 ? 2 : (c >> 3) == 30 ? 3 : -1;
        if (n < 0 || i + static_cast<size_t>(n) >= s.size()) return false;
        uint32_t cp = n == 0 ? c : c & (0x3F >> n);
        for (int k = 1; k <= n; k++) {
            unsigned char d = static_cast<unsigned char>(s[i + k]);
            if ((d >> 6) != 2) return false;
            cp = (cp << 6) | (d & 0x3F);
        }
        static const uint32_t minimum[] = {0, 0x80, 0x800, 0x10000};
        if (cp < minimum[n] || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return false;
        i += static_cast<size_t>(n) + 1;
    }
    return true;
}

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
            uint64_t length = 0;
            const char* s = plist_get_string_ptr(p, &length);
            std::string str = s ? std::string(s, length) : std::string();
            if (!validText(str)) {
                if (error) *error = "string is not valid UTF-8";
                return std::nullopt;
            }
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
            // The library's conversion of a date beyond 32-bit seconds yields these; such a
            // date could never be written back.
            if (sec == std::numeric_limits<int32_t>::min() || usec <= -1000000 || usec >= 1000000) {
                if (error) *error = "date out of range for a property list";
                return std::nullopt;
            }
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
                if (v && !validText(k)) {
                    if (error) *error = "key is not valid UTF-8";
                    v.reset();
                }
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

namespace {

uint64_t bigEndian(const uint8_t* p, size_t n) {
    uint64_t v = 0;
    for (size_t i = 0; i < n; i++) v = (v << 8) | p[i];
    return v;
}

// The parser aborts on strings and keys that hold a NUL, so a binary property
// list is screened first: every string object is checked before it is parsed. Any
// structure that does not add up is refused here as well.
bool screenBinaryPropertyList(const uint8_t* b, size_t n) {
    if (n < 8 + 32) return false;
    const uint8_t* trailer = b + n - 32;
    size_t offsetSize = trailer[6];
    uint64_t count = bigEndian(trailer + 8, 8);
    uint64_t tableOffset = bigEndian(trailer + 24, 8);
    if (offsetSize == 0 || offsetSize > 8 || tableOffset >= n - 32 || count > (n - 32 - tableOffset) / offsetSize)
        return false;
    for (uint64_t i = 0; i < count; i++) {
        uint64_t o = bigEndian(b + tableOffset + i * offsetSize, offsetSize);
        if (o < 8 || o >= tableOffset) return false;
        uint8_t marker = b[o];
        unsigned type = marker >> 4;
        if (type != 5 && type != 6) continue;
        uint64_t length = marker & 0xF;
        uint64_t start = o + 1;
        if (length == 0xF) {
            if (start >= tableOffset || (b[start] >> 4) != 1) return false;
            size_t intSize = size_t(1) << (b[start] & 0xF);
            if (intSize > 8 || start + 1 + intSize > tableOffset) return false;
            length = bigEndian(b + start + 1, intSize);
            start += 1 + intSize;
        }
        uint64_t unit = type == 6 ? 2 : 1;
        if (length > (tableOffset - start) / unit) return false;
        for (uint64_t k = 0; k < length; k++) {
            const uint8_t* c = b + start + k * unit;
            if (unit == 1 ? c[0] == 0 : (c[0] == 0 && c[1] == 0)) return false;
        }
    }
    return true;
}

// An XML property list with a NUL, raw or as a character reference, is refused
// before it reaches the parser for the same reason.
bool screenTextPropertyList(const char* t, size_t n) {
    if (std::memchr(t, 0, n)) return false;
    for (size_t i = 0; i + 2 < n; i++) {
        if (t[i] != '&' || t[i + 1] != '#') continue;
        size_t j = i + 2;
        if (j < n && (t[j] == 'x' || t[j] == 'X')) j++;
        size_t digits = j;
        while (j < n && t[j] == '0') j++;
        if (j > digits && j < n && t[j] == ';') return false;
    }
    return true;
}

}  // namespace

std::optional<Value> decodePropertyList(const void* bytes, size_t length, std::string* error) {
    if (length == 0 || length > std::numeric_limits<uint32_t>::max()) {
        if (error) *error = length == 0 ? "empty property list" : "property list too large";
        return std::nullopt;
    }
    const char* text = static_cast<const char*>(bytes);
    bool binary = length >= 8 && std::memcmp(text, "bplist00", 8) == 0;
    if (binary ? !screenBinaryPropertyList(static_cast<const uint8_t*>(bytes), length)
               : !screenTextPropertyList(text, length)) {
        if (error) *error = "malformed property list";
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
