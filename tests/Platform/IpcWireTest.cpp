#include "Platform/IpcWire.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

using namespace vsl;

namespace {

// Hand-assembled frame bytes, so refusals can be tested past the encoder's checks.
struct Bytes {
    std::string s;
    Bytes& u8(uint8_t v) {
        s.push_back(static_cast<char>(v));
        return *this;
    }
    Bytes& u16(uint16_t v) { return u8(v & 0xFF).u8(v >> 8); }
    Bytes& u32(uint32_t v) { return u16(v & 0xFFFF).u16(v >> 16); }
    Bytes& u64(uint64_t v) { return u32(static_cast<uint32_t>(v)).u32(static_cast<uint32_t>(v >> 32)); }
    Bytes& raw(std::string_view t) {
        s.append(t);
        return *this;
    }
    Bytes& str(std::string_view t) { return u32(static_cast<uint32_t>(t.size())).raw(t); }
    Bytes& header(uint64_t id = 9, uint16_t flags = 0, uint16_t version = 1) {
        return raw("VSLM").u16(version).u16(flags).u64(id);
    }
};

std::optional<IpcFrame> decode(const std::string& body, std::string* error = nullptr) {
    return decodeFrameBody(reinterpret_cast<const uint8_t*>(body.data()), body.size(), error);
}

// Body of a frame whose dictionary holds `value` (already encoded) under key "k".
std::string frameWith(std::string_view encodedValue) {
    return Bytes().header().u8(0x0B).u32(1).str("k").raw(encodedValue).s;
}

// `levels` nested containers, the outermost being the body dictionary.
std::string nested(size_t levels, bool arrays) {
    Bytes b;
    b.header().u8(0x0B);
    for (size_t i = 1; i < levels; ++i) {
        if (i == 1 || !arrays) {
            b.u32(1).str("n").u8(arrays ? 0x0A : 0x0B);
        } else {
            b.u32(1).u8(0x0A);
        }
    }
    b.u32(0);
    return b.s;
}

Value nestedValue(size_t levels) {
    Value v = Value::dictionary({});
    for (size_t i = 1; i < levels; ++i) v = dict({{"n", v}});
    return v;
}

}  // namespace

TEST(IpcWire, RoundTripsEveryType) {
    Uuid u = *Uuid::parse("0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0");
    const Value body = dict({
        {"null", Value::null()},
        {"false", Value::boolean(false)},
        {"true", Value::boolean(true)},
        {"u64", Value::uint64(std::numeric_limits<uint64_t>::max())},
        {"i64", Value::int64(std::numeric_limits<int64_t>::min())},
        {"double", Value::real(-0.5)},
        {"inf", Value::real(std::numeric_limits<double>::infinity())},
        {"string", Value::string("gr\xC3\xBC\xC3\x9F \xF0\x9F\x93\xA6")},
        {"empty", Value::string("")},
        {"data", Value::data({0, 1, 0xFF, 0})},
        {"uuid", Value::uuid(u)},
        {"date", Value::date(Date{-1234567890123})},
        {"array", Value::array({Value::uint64(1), Value::string("x"), Value::array({})})},
        {"dict", dict({{"inner", dict({{"deep", Value::boolean(true)}})}, {"", Value::null()}})},
    });
    for (uint16_t flags : {uint16_t{0}, kIpcFlagReply}) {
        auto frame = encodeFrame(0xFEDCBA9876543210ull, flags, body);
        ASSERT_TRUE(frame);
        auto length = decodeFrameLength(reinterpret_cast<const uint8_t*>(frame->data()));
        ASSERT_TRUE(length);
        EXPECT_EQ(*length, frame->size() - kIpcLengthPrefix);
        std::string error;
        auto decoded = decode(frame->substr(kIpcLengthPrefix), &error);
        ASSERT_TRUE(decoded) << error;
        EXPECT_EQ(decoded->messageId, 0xFEDCBA9876543210ull);
        EXPECT_EQ(decoded->flags, flags);
        EXPECT_EQ(decoded->body, body);
        // Signedness survives: a uint64 does not come back as an int64 or the reverse.
        EXPECT_EQ(decoded->body.find("u64")->type(), Value::Type::UInt64);
        EXPECT_EQ(decoded->body.find("i64")->type(), Value::Type::Int64);
        EXPECT_EQ(decoded->body.find("uuid")->uuidValue()->string(), u.string());
    }
    // NaN does not equal itself, so check its bits came through as a double.
    auto frame = encodeFrame(1, 0, dict({{"nan", Value::real(std::nan(""))}}));
    auto decoded = decode(frame->substr(kIpcLengthPrefix));
    ASSERT_TRUE(decoded);
    EXPECT_TRUE(std::isnan(*decoded->body.find("nan")->doubleValue()));
}

TEST(IpcWire, ExactBytesOfASmallFrame) {
    Uuid u = *Uuid::parse("00112233-4455-6677-8899-AABBCCDDEEFF");
    auto frame = encodeFrame(0x0102030405060708ull, kIpcFlagReply,
                             dict({{"A", Value::uint64(1)}, {"B", Value::array({Value::uuid(u), Value::int64(-2)})}}));
    ASSERT_TRUE(frame);
    const std::string expected = Bytes()
                                     .u32(16 + 1 + 4 + (4 + 1 + 1 + 8) + (4 + 1 + 1 + 4 + 17 + 9))
                                     .raw("VSLM").u16(1).u16(1).u64(0x0102030405060708ull)
                                     .u8(0x0B).u32(2)
                                     .str("A").u8(0x03).u64(1)
                                     .str("B").u8(0x0A).u32(2)
                                     .u8(0x08).raw(std::string_view("\x00\x11\x22\x33\x44\x55\x66\x77\x88\x99\xAA\xBB\xCC\xDD\xEE\xFF", 16))
                                     .u8(0x04).u64(static_cast<uint64_t>(-2))
                                     .s;
    EXPECT_EQ(*frame, expected);
    // Keys go out sorted, and decoding the hand-built form gives the same value back.
    auto decoded = decode(expected.substr(4));
    ASSERT_TRUE(decoded);
    EXPECT_EQ(*decoded->body.find("A")->uint64Value(), 1u);
}

TEST(IpcWire, DecoderRefusesEveryMalformedFrame) {
    const std::string good = frameWith(Bytes().u8(0x06).str("ok").s);
    ASSERT_TRUE(decode(good));

    struct Case {
        const char* name;
        std::string body;
    };
    std::string badMagic = good;
    badMagic[0] = 'X';
    std::vector<Case> cases = {
        {"bad magic", badMagic},
        {"version 2", Bytes().header(1, 0, 2).u8(0x0B).u32(0).s},
        {"version 0", Bytes().header(1, 0, 0).u8(0x0B).u32(0).s},
        {"unknown flag", Bytes().header(1, 0x2).u8(0x0B).u32(0).s},
        {"no body", Bytes().header().s},
        {"array body", Bytes().header().u8(0x0A).u32(0).s},
        {"string body", Bytes().header().u8(0x06).str("x").s},
        {"null body", Bytes().header().u8(0x00).s},
        {"unknown tag", frameWith(Bytes().u8(0x0C).s)},
        {"tag 0xFF", frameWith(Bytes().u8(0xFF).s)},
        {"overlong NUL", frameWith(Bytes().u8(0x06).str("\xC0\x80").s)},
        {"surrogate", frameWith(Bytes().u8(0x06).str("\xED\xA0\x80").s)},
        {"above U+10FFFF", frameWith(Bytes().u8(0x06).str("\xF4\x90\x80\x80").s)},
        {"lone continuation", frameWith(Bytes().u8(0x06).str("a\x80").s)},
        {"cut sequence", frameWith(Bytes().u8(0x06).str("\xE2\x82").s)},
        {"NUL in string", frameWith(Bytes().u8(0x06).str(std::string_view("a\0b", 3)).s)},
        {"NUL in key", Bytes().header().u8(0x0B).u32(1).str(std::string_view("k\0", 2)).u8(0x00).s},
        {"bad key", Bytes().header().u8(0x0B).u32(1).str("\xFF").u8(0x00).s},
        {"duplicate key", Bytes().header().u8(0x0B).u32(2).str("k").u8(0x00).str("k").u8(0x01).s},
        {"nested duplicate", frameWith(Bytes().u8(0x0B).u32(2).str("a").u8(1).str("a").u8(2).s)},
        {"trailing byte", good + std::string(1, '\0')},
        {"count beyond the bytes", frameWith(Bytes().u8(0x0A).u32(0xFFFFFFFF).u8(0x00).s)},
        {"dictionary count lies", Bytes().header().u8(0x0B).u32(3).str("k").u8(0x00).s},
        {"string length lies", frameWith(Bytes().u8(0x06).u32(0xFFFFFFF0).raw("ab").s)},
        {"data length lies", frameWith(Bytes().u8(0x07).u32(100).raw("ab").s)},
        {"short uuid", frameWith(Bytes().u8(0x08).raw("0123456789").s)},
        {"too deep (dictionaries)", nested(65, false)},
        {"too deep (arrays)", nested(65, true)},
    };
    for (const Case& c : cases) {
        std::string error;
        EXPECT_FALSE(decode(c.body, &error)) << c.name;
        EXPECT_FALSE(error.empty()) << c.name;
    }
    EXPECT_TRUE(decode(nested(64, false)));
    EXPECT_TRUE(decode(nested(64, true)));

    // Every proper prefix of a valid frame is truncated.
    const std::string full = encodeFrame(3, 0, dict({{"a", Value::array({Value::string("xyz"), Value::uint64(5)})},
                                                      {"b", Value::data({1, 2, 3})}}))
                                 ->substr(kIpcLengthPrefix);
    ASSERT_TRUE(decode(full));
    for (size_t n = 0; n < full.size(); ++n) EXPECT_FALSE(decode(full.substr(0, n))) << n;

    // The length prefix: over 16 MiB or too short for a header is refused before
    // any body is read.
    auto lengthOf = [](uint32_t n) {
        std::string p = Bytes().u32(n).s;
        return decodeFrameLength(reinterpret_cast<const uint8_t*>(p.data()));
    };
    EXPECT_EQ(lengthOf(kIpcMaxFrameLength), kIpcMaxFrameLength);
    EXPECT_FALSE(lengthOf(kIpcMaxFrameLength + 1));
    EXPECT_FALSE(lengthOf(0xFFFFFFFF));
    EXPECT_FALSE(lengthOf(0));
    EXPECT_FALSE(lengthOf(kIpcHeaderLength + 4));
    EXPECT_EQ(lengthOf(kIpcHeaderLength + 5), kIpcHeaderLength + 5);
}

TEST(IpcWire, EncoderRefusesWhatTheOtherSideWouldReject) {
    std::string error;
    EXPECT_FALSE(encodeFrame(1, 0, Value::array({}), &error));
    EXPECT_FALSE(encodeFrame(1, 0, Value::null(), &error));
    EXPECT_FALSE(encodeFrame(1, 0x4, dict({}), &error));
    EXPECT_FALSE(encodeFrame(1, 0, dict({{"s", Value::string(std::string("a\0b", 3))}}), &error));
    EXPECT_FALSE(encodeFrame(1, 0, dict({{"s", Value::array({Value::string("\xC3")})}}), &error));
    EXPECT_FALSE(encodeFrame(1, 0, dict({{std::string("k\0", 2), Value::null()}}), &error));
    EXPECT_TRUE(encodeFrame(1, 0, nestedValue(64), &error)) << error;
    EXPECT_FALSE(encodeFrame(1, 0, nestedValue(65), &error));
    EXPECT_FALSE(encodeFrame(1, 0, dict({{"big", Value::data(Data(kIpcMaxFrameLength, 0))}}), &error));
    EXPECT_TRUE(encodeFrame(1, 0, dict({{"big", Value::data(Data(kIpcMaxFrameLength - 64, 0))}}), &error)) << error;
}
