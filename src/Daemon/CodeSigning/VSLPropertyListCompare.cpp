#include "Daemon/CodeSigning/VSLPropertyListCompare.h"

#include <cmath>
#include <cstring>
#include <functional>
#include <limits>
#include <string_view>

namespace vsl {

namespace {

bool isInteger(const Value& v) {
    return v.type() == Value::Type::UInt64 || v.type() == Value::Type::Int64;
}

bool integersEqual(const Value& a, const Value& b) {
    if (a.type() == b.type()) return a == b;
    const Value& s = a.type() == Value::Type::Int64 ? a : b;
    const Value& u = a.type() == Value::Type::Int64 ? b : a;
    int64_t i = *s.int64Value();
    return i >= 0 && static_cast<uint64_t>(i) == *u.uint64Value();
}

bool numberEqualsDouble(const Value& n, double d) {
    if (n.type() == Value::Type::Double) return *n.doubleValue() == d;
    if (n.type() == Value::Type::UInt64) return static_cast<double>(*n.uint64Value()) == d && d >= 0;
    return static_cast<double>(*n.int64Value()) == d;
}

// 16 bytes of a uuid or of data of that length.
bool uuidBytes(const Value& v, Uuid* out) {
    if (auto u = v.uuidValue()) {
        *out = *u;
        return true;
    }
    const Data* d = v.dataValue();
    if (!d || d->size() != 16) return false;
    std::memcpy(out->bytes.data(), d->data(), 16);
    return true;
}

size_t mix(size_t seed, size_t h) {
    return seed ^ (h + 0x9e3779b97f4a7c15ULL + (seed << 6) + (seed >> 2));
}

}  // namespace

bool propertyListValuesEqual(const Value& a, const Value& b) {
    if (a.isNumber() && b.isNumber()) {
        if (isInteger(a) && isInteger(b)) return integersEqual(a, b);
        if (a.type() == Value::Type::Double) return numberEqualsDouble(b, *a.doubleValue());
        return numberEqualsDouble(a, *b.doubleValue());
    }
    Uuid ua, ub;
    if ((a.type() == Value::Type::Uuid || b.type() == Value::Type::Uuid) && uuidBytes(a, &ua) && uuidBytes(b, &ub))
        return ua == ub;
    if (a.type() != b.type()) return false;
    if (const Array* x = a.arrayValue()) {
        const Array& y = *b.arrayValue();
        if (x->size() != y.size()) return false;
        for (size_t i = 0; i < x->size(); i++)
            if (!propertyListValuesEqual((*x)[i], y[i])) return false;
        return true;
    }
    if (const Dictionary* x = a.dictionaryValue()) {
        const Dictionary& y = *b.dictionaryValue();
        if (x->size() != y.size()) return false;
        for (auto i = x->begin(), j = y.begin(); i != x->end(); ++i, ++j)
            if (i->first != j->first || !propertyListValuesEqual(i->second, j->second)) return false;
        return true;
    }
    return a == b;
}

size_t propertyListHash(const Value& v) {
    switch (v.type()) {
        case Value::Type::UInt64:
            return std::hash<uint64_t>()(*v.uint64Value());
        case Value::Type::Int64:
            return std::hash<uint64_t>()(static_cast<uint64_t>(*v.int64Value()));
        case Value::Type::Double: {
            double d = *v.doubleValue();
            // Integral doubles hash as the integer they equal.
            if (std::trunc(d) == d && d >= -9.2e18 && d <= 1.8e19)
                return d < 0 ? std::hash<uint64_t>()(static_cast<uint64_t>(static_cast<int64_t>(d)))
                             : std::hash<uint64_t>()(static_cast<uint64_t>(d));
            return std::hash<double>()(d);
        }
        case Value::Type::Uuid:
            return v.uuidValue()->hash();
        case Value::Type::Data: {
            Uuid u;
            if (uuidBytes(v, &u)) return u.hash();
            const Data& d = *v.dataValue();
            return std::hash<std::string_view>()(std::string_view(reinterpret_cast<const char*>(d.data()), d.size()));
        }
        case Value::Type::String:
            return std::hash<std::string>()(*v.stringValue());
        case Value::Type::Array: {
            size_t h = 0xA;
            for (const auto& item : *v.arrayValue()) h = mix(h, propertyListHash(item));
            return h;
        }
        case Value::Type::Dictionary: {
            size_t h = 0xD;
            for (const auto& [k, item] : *v.dictionaryValue())
                h = mix(mix(h, std::hash<std::string>()(k)), propertyListHash(item));
            return h;
        }
        case Value::Type::Bool:
            return *v.boolValue() ? 0xB1 : 0xB0;
        case Value::Type::Date:
            return std::hash<int64_t>()(v.dateValue()->nanoseconds);
        case Value::Type::Null:
            return 0;
    }
    return 0;
}

bool propertyListTruthValue(const Value* v) {
    if (!v) return false;
    if (auto b = v->boolValue()) return *b;
    if (auto d = v->doubleValue()) return *d != 0;
    if (auto n = v->unsignedNumber()) return *n != 0;
    return false;
}

}  // namespace vsl
