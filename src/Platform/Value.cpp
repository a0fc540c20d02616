#include "Platform/Value.h"

#include <uuid/uuid.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <variant>

namespace vsl {

// ---- Uuid ----

Uuid Uuid::random() {
    Uuid u;
    uuid_generate_random(u.bytes.data());
    return u;
}

std::optional<Uuid> Uuid::parse(std::string_view text) {
    if (text.size() != 36) return std::nullopt;
    char buf[37];
    std::memcpy(buf, text.data(), 36);
    buf[36] = 0;
    Uuid u;
    if (uuid_parse(buf, u.bytes.data()) != 0) return std::nullopt;
    return u;
}

std::optional<Uuid> Uuid::fromBytes(const void* p, size_t n) {
    if (n != 16 || !p) return std::nullopt;
    Uuid u;
    std::memcpy(u.bytes.data(), p, 16);
    return u;
}

std::string Uuid::string() const {
    char buf[37];
    uuid_unparse_upper(bytes.data(), buf);
    return buf;
}

bool Uuid::isNull() const {
    for (auto b : bytes)
        if (b) return false;
    return true;
}

size_t Uuid::hash() const {
    uint64_t a, b;
    std::memcpy(&a, bytes.data(), 8);
    std::memcpy(&b, bytes.data() + 8, 8);
    return std::hash<uint64_t>{}(a ^ (b * 0x9E3779B97F4A7C15ull));
}

Date Date::now() {
    auto t = std::chrono::system_clock::now().time_since_epoch();
    return Date{std::chrono::duration_cast<std::chrono::nanoseconds>(t).count()};
}

// ---- Value ----

struct Value::Node {
    std::variant<std::monostate, bool, uint64_t, int64_t, double, std::string, Data, Uuid, Date, Array,
                 Dictionary>
        v;
};

namespace {
const std::shared_ptr<const Value::Node>& nullNode() {
    static const auto n = std::make_shared<const Value::Node>();
    return n;
}
}  // namespace

Value::Value() : node_(nullNode()) {}

#define VSL_VALUE_FACTORY(name, T)                                              \
    Value Value::name(T x) {                                                    \
        return Value(std::make_shared<const Node>(Node{std::move(x)}));         \
    }
VSL_VALUE_FACTORY(boolean, bool)
VSL_VALUE_FACTORY(uint64, uint64_t)
VSL_VALUE_FACTORY(int64, int64_t)
VSL_VALUE_FACTORY(real, double)
VSL_VALUE_FACTORY(string, std::string)
VSL_VALUE_FACTORY(data, Data)
VSL_VALUE_FACTORY(date, Date)
VSL_VALUE_FACTORY(array, Array)
VSL_VALUE_FACTORY(dictionary, Dictionary)
#undef VSL_VALUE_FACTORY
Value Value::uuid(const Uuid& u) { return Value(std::make_shared<const Node>(Node{u})); }

Value::Type Value::type() const { return static_cast<Type>(node_->v.index()); }

const char* Value::typeName() const {
    static const char* const names[] = {"null",  "bool", "uint64", "int64", "double",    "string",
                                        "data", "uuid", "date",   "array", "dictionary"};
    return names[node_->v.index()];
}

bool Value::isNumber() const {
    auto t = type();
    return t == Type::UInt64 || t == Type::Int64 || t == Type::Double;
}

template <class T>
static std::optional<T> valueAs(const auto& v) {
    if (auto p = std::get_if<T>(&v)) return *p;
    return std::nullopt;
}

std::optional<bool> Value::boolValue() const { return valueAs<bool>(node_->v); }
std::optional<uint64_t> Value::uint64Value() const { return valueAs<uint64_t>(node_->v); }
std::optional<int64_t> Value::int64Value() const { return valueAs<int64_t>(node_->v); }
std::optional<double> Value::doubleValue() const { return valueAs<double>(node_->v); }
std::optional<Uuid> Value::uuidValue() const { return valueAs<Uuid>(node_->v); }
std::optional<Date> Value::dateValue() const { return valueAs<Date>(node_->v); }
const std::string* Value::stringValue() const { return std::get_if<std::string>(&node_->v); }
const Data* Value::dataValue() const { return std::get_if<Data>(&node_->v); }
const Array* Value::arrayValue() const { return std::get_if<Array>(&node_->v); }
const Dictionary* Value::dictionaryValue() const { return std::get_if<Dictionary>(&node_->v); }

std::optional<uint64_t> Value::unsignedNumber() const {
    if (auto u = uint64Value()) return u;
    if (auto i = int64Value()) return static_cast<uint64_t>(*i);
    if (auto d = doubleValue()) {
        // Whatever no 64-bit integer holds is no number at all (converting it is undefined).
        if (!(*d >= -0x1p63 && *d < 0x1p64)) return std::nullopt;
        return *d < 0 ? static_cast<uint64_t>(static_cast<int64_t>(*d)) : static_cast<uint64_t>(*d);
    }
    return std::nullopt;
}

std::optional<int64_t> Value::signedNumber() const {
    if (auto u = unsignedNumber()) return static_cast<int64_t>(*u);
    return std::nullopt;
}

const Value* Value::find(std::string_view key) const {
    auto d = dictionaryValue();
    if (!d) return nullptr;
    auto it = d->find(key);
    return it == d->end() ? nullptr : &it->second;
}

bool Value::operator==(const Value& other) const {
    return node_ == other.node_ || node_->v == other.node_->v;
}

namespace {

bool needsQuotes(const std::string& s) {
    if (s.empty()) return true;
    for (unsigned char c : s)
        if (!(std::isalnum(c) || c == '.' || c == '_' || c == '-' || c == '/' || c == ':' || c == '$'))
            return true;
    return false;
}

std::string quoted(const std::string& s) {
    if (!needsQuotes(s)) return s;
    std::string out = "\"";
    for (char c : s) {
        if (c == '"' || c == '\\') out += '\\';
        if (c == '\n') {
            out += "\\n";
            continue;
        }
        out += c;
    }
    return out + "\"";
}

void describe(const Value& v, int indent, std::string& out, bool top) {
    std::string pad(indent * 4, ' ');
    std::string inner((indent + 1) * 4, ' ');
    switch (v.type()) {
        case Value::Type::Null: out += "<null>"; break;
        case Value::Type::Bool: out += *v.boolValue() ? "1" : "0"; break;
        case Value::Type::UInt64: out += std::to_string(*v.uint64Value()); break;
        case Value::Type::Int64: out += std::to_string(*v.int64Value()); break;
        case Value::Type::Double: {
            char buf[64];
            std::snprintf(buf, sizeof buf, "%.17g", *v.doubleValue());
            out += buf;
            break;
        }
        case Value::Type::String: out += top ? *v.stringValue() : quoted(*v.stringValue()); break;
        case Value::Type::Data: {
            const Data& bytes = *v.dataValue();
            out += "{length = " + std::to_string(bytes.size()) + ", bytes = 0x";
            out += hexDigits(bytes.data(), std::min<size_t>(bytes.size(), 24));
            if (bytes.size() > 24) out += "...";
            out += "}";
            break;
        }
        case Value::Type::Uuid: out += v.uuidValue()->string(); break;
        case Value::Type::Date: {
            int64_t ns = v.dateValue()->nanoseconds;
            time_t secs = static_cast<time_t>(ns / 1000000000);
            struct tm tm;
            gmtime_r(&secs, &tm);
            char buf[64];
            std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S +0000", &tm);
            out += buf;
            break;
        }
        case Value::Type::Array: {
            out += "(\n";
            const auto& a = *v.arrayValue();
            for (size_t i = 0; i < a.size(); i++) {
                out += inner;
                describe(a[i], indent + 1, out, false);
                out += i + 1 < a.size() ? ",\n" : "\n";
            }
            out += pad + ")";
            break;
        }
        case Value::Type::Dictionary: {
            out += "{\n";
            for (const auto& [k, val] : *v.dictionaryValue()) {
                out += inner + quoted(k) + " = ";
                describe(val, indent + 1, out, false);
                out += ";\n";
            }
            out += pad + "}";
            break;
        }
    }
}

}  // namespace

std::string Value::description() const {
    std::string out;
    describe(*this, 0, out, true);
    return out;
}

std::string hexDigits(const uint8_t* p, size_t n) {
    static const char digits[] = "0123456789abcdef";
    std::string out;
    out.reserve(n * 2);
    for (size_t i = 0; i < n; i++) {
        out += digits[p[i] >> 4];
        out += digits[p[i] & 15];
    }
    return out;
}

}  // namespace vsl
