// Typed, immutable values: what the daemon passes around as dictionaries, what the
// IPC wire carries and what property-list files hold. Copies share one node.
#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace vsl {

class Value;
using Array = std::vector<Value>;
using Dictionary = std::map<std::string, Value, std::less<>>;
using Data = std::vector<uint8_t>;

struct Uuid {
    std::array<uint8_t, 16> bytes{};

    static Uuid random();
    // Canonical hyphenated form, either case; nothing else.
    static std::optional<Uuid> parse(std::string_view text);
    static std::optional<Uuid> fromBytes(const void* p, size_t n);
    std::string string() const;  // upper-case, hyphenated
    bool isNull() const;
    size_t hash() const;
    auto operator<=>(const Uuid&) const = default;
};

struct Date {
    int64_t nanoseconds = 0;  // since 1970-01-01 UTC
    static Date now();
    auto operator<=>(const Date&) const = default;
};

class Value {
public:
    enum class Type { Null, Bool, UInt64, Int64, Double, String, Data, Uuid, Date, Array, Dictionary };

    Value();  // null
    static Value null() { return Value(); }
    static Value boolean(bool b);
    static Value uint64(uint64_t v);
    static Value int64(int64_t v);
    static Value real(double v);
    static Value string(std::string s);
    static Value data(Data d);
    static Value uuid(const Uuid& u);
    static Value date(Date d);
    static Value array(Array a);
    static Value dictionary(Dictionary d);

    Type type() const;
    const char* typeName() const;
    bool isNull() const { return type() == Type::Null; }
    bool isNumber() const;  // uint64, int64 or double
    bool isString() const { return type() == Type::String; }
    bool isDictionary() const { return type() == Type::Dictionary; }
    bool isArray() const { return type() == Type::Array; }

    // Strict accessors: a value of another type yields none.
    std::optional<bool> boolValue() const;
    std::optional<uint64_t> uint64Value() const;
    std::optional<int64_t> int64Value() const;
    std::optional<double> doubleValue() const;
    const std::string* stringValue() const;
    const Data* dataValue() const;
    std::optional<Uuid> uuidValue() const;
    std::optional<Date> dateValue() const;
    const Array* arrayValue() const;
    const Dictionary* dictionaryValue() const;

    // A number read as unsigned, whatever its stored signedness (doubles truncate);
    // property lists do not keep signedness for every writer.
    std::optional<uint64_t> unsignedNumber() const;
    std::optional<int64_t> signedNumber() const;

    // Dictionary member or null when absent or not a dictionary.
    const Value* find(std::string_view key) const;

    // Human-readable, in the style of the platform's object descriptions.
    std::string description() const;

    bool operator==(const Value& other) const;

    struct Node;  // opaque

private:
    explicit Value(std::shared_ptr<const Node> n) : node_(std::move(n)) {}
    std::shared_ptr<const Node> node_;
};

// Lower-case hexadecimal of the first n bytes.
std::string hexDigits(const uint8_t* p, size_t n);

// Small builder to make dictionary literals readable.
inline Value dict(std::initializer_list<std::pair<const std::string, Value>> items) {
    return Value::dictionary(Dictionary(items));
}

}  // namespace vsl

template <>
struct std::hash<vsl::Uuid> {
    size_t operator()(const vsl::Uuid& u) const noexcept { return u.hash(); }
};
