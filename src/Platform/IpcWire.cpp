#include "Platform/IpcWire.h"

#include <cstring>

namespace vsl {

namespace {

enum Tag : uint8_t {
    kNull = 0x00, kFalse = 0x01, kTrue = 0x02, kUInt64 = 0x03, kInt64 = 0x04, kDouble = 0x05,
    kString = 0x06, kData = 0x07, kUuid = 0x08, kDate = 0x09, kArray = 0x0A, kDictionary = 0x0B,
};

constexpr char kMagic[4] = {'V', 'S', 'L', 'M'};

// Strict UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF, no NUL.
bool isCleanUtf8(const uint8_t* s, size_t n) {
    size_t i = 0;
    while (i < n) {
        const uint8_t c = s[i];
        if (c == 0) return false;
        if (c < 0x80) {
            ++i;
            continue;
        }
        size_t extra;
        uint32_t cp;
        if (c >= 0xC2 && c <= 0xDF) {
            extra = 1;
            cp = c & 0x1F;
        } else if (c >= 0xE0 && c <= 0xEF) {
            extra = 2;
            cp = c & 0x0F;
        } else if (c >= 0xF0 && c <= 0xF4) {
            extra = 3;
            cp = c & 0x07;
        } else {
            return false;
        }
        if (n - i <= extra) return false;
        for (size_t k = 1; k <= extra; ++k) {
            const uint8_t cc = s[i + k];
            if ((cc & 0xC0) != 0x80) return false;
            cp = (cp << 6) | (cc & 0x3F);
        }
        if ((extra == 2 && (cp < 0x800 || (cp >= 0xD800 && cp <= 0xDFFF))) ||
            (extra == 3 && (cp < 0x10000 || cp > 0x10FFFF))) {
            return false;
        }
        i += extra + 1;
    }
    return true;
}

bool isCleanUtf8(std::string_view s) {
    return isCleanUtf8(reinterpret_cast<const uint8_t*>(s.data()), s.size());
}

// ---- encoding ----

class Encoder {
public:
    explicit Encoder(std::string& out) : out_(out) {}

    bool value(const Value& v, size_t depth) {
        switch (v.type()) {
        case Value::Type::Null: return tag(kNull);
        case Value::Type::Bool: return tag(*v.boolValue() ? kTrue : kFalse);
        case Value::Type::UInt64: return tag(kUInt64) && u64(*v.uint64Value());
        case Value::Type::Int64: return tag(kInt64) && u64(static_cast<uint64_t>(*v.int64Value()));
        case Value::Type::Double: {
            const double d = *v.doubleValue();
            uint64_t bits;
            std::memcpy(&bits, &d, 8);
            return tag(kDouble) && u64(bits);
        }
        case Value::Type::String: {
            const std::string& s = *v.stringValue();
            if (!isCleanUtf8(s)) return fail("string is not UTF-8 or holds a NUL");
            return tag(kString) && bytes(s.data(), s.size());
        }
        case Value::Type::Data: {
            const Data& d = *v.dataValue();
            return tag(kData) && bytes(d.data(), d.size());
        }
        case Value::Type::Uuid: {
            const Uuid u = *v.uuidValue();
            tag(kUuid);
            out_.append(reinterpret_cast<const char*>(u.bytes.data()), 16);
            return true;
        }
        case Value::Type::Date:
            return tag(kDate) && u64(static_cast<uint64_t>(v.dateValue()->nanoseconds));
        case Value::Type::Array: {
            if (depth > kIpcMaxDepth) return fail("nested too deeply");
            const Array& a = *v.arrayValue();
            tag(kArray);
            if (!count(a.size())) return false;
            for (const Value& item : a)
                if (!value(item, depth + 1)) return false;
            return true;
        }
        case Value::Type::Dictionary: {
            if (depth > kIpcMaxDepth) return fail("nested too deeply");
            const Dictionary& d = *v.dictionaryValue();
            tag(kDictionary);
            if (!count(d.size())) return false;
            for (const auto& [key, item] : d) {
                if (!isCleanUtf8(key)) return fail("key is not UTF-8 or holds a NUL");
                if (!bytes(key.data(), key.size()) || !value(item, depth + 1)) return false;
            }
            return true;
        }
        }
        return fail("unknown value type");
    }

    std::string error;

private:
    bool tag(uint8_t t) {
        out_.push_back(static_cast<char>(t));
        return true;
    }
    bool u32(uint32_t v) {
        char b[4];
        for (int i = 0; i < 4; ++i) b[i] = static_cast<char>(v >> (8 * i));
        out_.append(b, 4);
        return true;
    }
    bool u64(uint64_t v) {
        char b[8];
        for (int i = 0; i < 8; ++i) b[i] = static_cast<char>(v >> (8 * i));
        out_.append(b, 8);
        return true;
    }
    bool count(size_t n) {
        if (n > UINT32_MAX || out_.size() > kIpcMaxFrameLength + kIpcLengthPrefix)
            return fail("frame too large");
        return u32(static_cast<uint32_t>(n));
    }
    bool bytes(const void* p, size_t n) {
        if (n > kIpcMaxFrameLength) return fail("frame too large");
        if (!count(n)) return false;
        out_.append(static_cast<const char*>(p), n);
        return true;
    }
    bool fail(const char* why) {
        error = why;
        return false;
    }

    std::string& out_;
};

// ---- decoding ----

class Decoder {
public:
    Decoder(const uint8_t* p, size_t n) : p_(p), end_(p + n) {}

    std::optional<Value> value(size_t depth) {
        uint8_t t;
        if (!byte(t)) return std::nullopt;
        switch (t) {
        case kNull: return Value::null();
        case kFalse: return Value::boolean(false);
        case kTrue: return Value::boolean(true);
        case kUInt64: {
            uint64_t v;
            if (!u64(v)) return std::nullopt;
            return Value::uint64(v);
        }
        case kInt64: {
            uint64_t v;
            if (!u64(v)) return std::nullopt;
            return Value::int64(static_cast<int64_t>(v));
        }
        case kDouble: {
            uint64_t bits;
            if (!u64(bits)) return std::nullopt;
            double d;
            std::memcpy(&d, &bits, 8);
            return Value::real(d);
        }
        case kString: {
            std::string s;
            if (!text(s, "string")) return std::nullopt;
            return Value::string(std::move(s));
        }
        case kData: {
            uint32_t n;
            if (!u32(n) || !need(n)) return std::nullopt;
            Data d(p_, p_ + n);
            p_ += n;
            return Value::data(std::move(d));
        }
        case kUuid: {
            if (!need(16)) return std::nullopt;
            auto u = Uuid::fromBytes(p_, 16);
            p_ += 16;
            return Value::uuid(*u);
        }
        case kDate: {
            uint64_t v;
            if (!u64(v)) return std::nullopt;
            return Value::date(Date{static_cast<int64_t>(v)});
        }
        case kArray: {
            if (depth > kIpcMaxDepth) return fail("nested too deeply");
            uint32_t n;
            // Every element takes at least one byte: a count beyond what is left lies.
            if (!u32(n) || !need(n)) return std::nullopt;
            Array a;
            a.reserve(n);
            for (uint32_t i = 0; i < n; ++i) {
                auto item = value(depth + 1);
                if (!item) return std::nullopt;
                a.push_back(std::move(*item));
            }
            return Value::array(std::move(a));
        }
        case kDictionary: return dictionary(depth);
        default: return fail("unknown tag");
        }
    }

    std::optional<Value> dictionary(size_t depth) {
        if (depth > kIpcMaxDepth) return fail("nested too deeply");
        uint32_t n;
        if (!u32(n)) return std::nullopt;
        Dictionary d;
        for (uint32_t i = 0; i < n; ++i) {
            std::string key;
            if (!text(key, "key")) return std::nullopt;
            auto item = value(depth + 1);
            if (!item) return std::nullopt;
            if (!d.emplace(std::move(key), std::move(*item)).second) return fail("duplicate key");
        }
        return Value::dictionary(std::move(d));
    }

    bool byte(uint8_t& v) {
        if (!need(1)) return false;
        v = *p_++;
        return true;
    }
    bool u16(uint16_t& v) {
        if (!need(2)) return false;
        v = static_cast<uint16_t>(p_[0] | (p_[1] << 8));
        p_ += 2;
        return true;
    }
    bool u32(uint32_t& v) {
        if (!need(4)) return false;
        v = 0;
        for (int i = 3; i >= 0; --i) v = (v << 8) | p_[i];
        p_ += 4;
        return true;
    }
    bool u64(uint64_t& v) {
        if (!need(8)) return false;
        v = 0;
        for (int i = 7; i >= 0; --i) v = (v << 8) | p_[i];
        p_ += 8;
        return true;
    }
    bool text(std::string& s, const char* what) {
        uint32_t n;
        if (!u32(n) || !need(n)) return false;
        if (!isCleanUtf8(p_, n)) {
            error = std::string(what) + " is not UTF-8 or holds a NUL";
            return false;
        }
        s.assign(reinterpret_cast<const char*>(p_), n);
        p_ += n;
        return true;
    }
    bool need(size_t n) {
        if (static_cast<size_t>(end_ - p_) >= n) return true;
        if (error.empty()) error = "truncated";
        return false;
    }
    std::nullopt_t fail(const char* why) {
        error = why;
        return std::nullopt;
    }
    size_t remaining() const { return static_cast<size_t>(end_ - p_); }
    const uint8_t* cursor() const { return p_; }
    void skip(size_t n) { p_ += n; }

    std::string error;

private:
    const uint8_t* p_;
    const uint8_t* end_;
};

void setError(std::string* error, std::string text) {
    if (error) *error = std::move(text);
}

}  // namespace

std::optional<std::string> encodeFrame(uint64_t messageId, uint16_t flags, const Value& body,
                                       std::string* error) {
    if (!body.isDictionary()) {
        setError(error, "body is not a dictionary");
        return std::nullopt;
    }
    if ((flags & ~kIpcFlagReply) != 0) {
        setError(error, "unknown flags");
        return std::nullopt;
    }
    std::string out;
    out.reserve(64);
    out.append(4, '\0');  // length, filled in below
    out.append(kMagic, 4);
    const uint8_t head[12] = {
        static_cast<uint8_t>(kIpcVersion), static_cast<uint8_t>(kIpcVersion >> 8),
        static_cast<uint8_t>(flags), static_cast<uint8_t>(flags >> 8),
        static_cast<uint8_t>(messageId), static_cast<uint8_t>(messageId >> 8),
        static_cast<uint8_t>(messageId >> 16), static_cast<uint8_t>(messageId >> 24),
        static_cast<uint8_t>(messageId >> 32), static_cast<uint8_t>(messageId >> 40),
        static_cast<uint8_t>(messageId >> 48), static_cast<uint8_t>(messageId >> 56),
    };
    out.append(reinterpret_cast<const char*>(head), sizeof head);
    Encoder encoder(out);
    if (!encoder.value(body, 1)) {
        setError(error, encoder.error);
        return std::nullopt;
    }
    const size_t length = out.size() - kIpcLengthPrefix;
    if (length > kIpcMaxFrameLength) {
        setError(error, "frame too large");
        return std::nullopt;
    }
    for (int i = 0; i < 4; ++i) out[i] = static_cast<char>(length >> (8 * i));
    return out;
}

std::optional<uint32_t> decodeFrameLength(const uint8_t prefix[kIpcLengthPrefix]) {
    const uint32_t n = static_cast<uint32_t>(prefix[0]) | (static_cast<uint32_t>(prefix[1]) << 8) |
                       (static_cast<uint32_t>(prefix[2]) << 16) |
                       (static_cast<uint32_t>(prefix[3]) << 24);
    // The smallest frame is a header and an empty dictionary.
    if (n > kIpcMaxFrameLength || n < kIpcHeaderLength + 5) return std::nullopt;
    return n;
}

std::optional<IpcFrame> decodeFrameBody(const uint8_t* bytes, size_t length, std::string* error) {
    if (length > kIpcMaxFrameLength) {
        setError(error, "frame too large");
        return std::nullopt;
    }
    Decoder in(bytes, length);
    if (!in.need(kIpcHeaderLength)) {
        setError(error, "truncated header");
        return std::nullopt;
    }
    if (std::memcmp(in.cursor(), kMagic, 4) != 0) {
        setError(error, "bad magic");
        return std::nullopt;
    }
    in.skip(4);
    IpcFrame frame;
    uint16_t version = 0;
    in.u16(version);
    in.u16(frame.flags);
    in.u64(frame.messageId);
    if (version != kIpcVersion) {
        setError(error, "unsupported version " + std::to_string(version));
        return std::nullopt;
    }
    if ((frame.flags & ~kIpcFlagReply) != 0) {
        setError(error, "unknown flags");
        return std::nullopt;
    }
    uint8_t tag;
    if (!in.byte(tag)) {
        setError(error, "missing body");
        return std::nullopt;
    }
    if (tag != kDictionary) {
        setError(error, "body is not a dictionary");
        return std::nullopt;
    }
    auto body = in.dictionary(1);
    if (!body) {
        setError(error, in.error.empty() ? "malformed body" : in.error);
        return std::nullopt;
    }
    if (in.remaining() != 0) {
        setError(error, "trailing bytes");
        return std::nullopt;
    }
    frame.body = std::move(*body);
    return frame;
}

}  // namespace vsl
