#include "PackbuffTestSupport.h"

#include <gtest/gtest.h>

#include <cerrno>

using namespace packbuff_test;

namespace {

// Reads every item with the call its type calls for; returns the first error, or 0 at the end marker.
int walk(sb_packbuff* pb) {
    for (;;) {
        const auto offset = pb->item - pb->item_buffer;
        uint16_t itemType = 0;
        if (offset >= 0 && static_cast<uint64_t>(offset) + 2 <= pb->bytes_allocated)
            std::memcpy(&itemType, pb->item, 2);
        int error = 0;
        size_t length = 0;
        switch (itemType) {
        case SB_PACKBUFF_ITEM_END:
            return 0;
        case SB_PACKBUFF_ITEM_UINT32:
            sb_packbuff_unpack_uint32(pb, &error);
            break;
        case SB_PACKBUFF_ITEM_STRING:
            sb_packbuff_unpack_string(pb, &length, &error);
            break;
        case SB_PACKBUFF_ITEM_BYTES:
            sb_packbuff_unpack_bytes(pb, &length, &error);
            break;
        default:
            error = sb_packbuff_skip_item(pb);
        }
        if (error != 0) return error;
    }
}

}  // namespace

TEST(PackbuffReader, RoundTripsEveryKindAndLength) {
    Handle pb(sb_packbuff_new(16));
    std::string text;
    for (size_t n = 0; n <= 17; ++n) text.push_back(static_cast<char>('a' + n));
    const uint32_t numbers[] = {0, 1, 0x7FFFFFFF, 0xFFFFFFFF};
    for (uint32_t v : numbers) ASSERT_EQ(sb_packbuff_pack_uint32(pb.get(), static_cast<uint16_t>(v), v), 0);
    for (size_t n = 0; n <= 17; ++n) {
        ASSERT_EQ(sb_packbuff_pack_string(pb.get(), static_cast<uint16_t>(100 + n), text.substr(0, n).c_str(), n), 0);
        ASSERT_EQ(sb_packbuff_pack_bytes(pb.get(), static_cast<uint16_t>(200 + n), text.data(), n), 0);
    }
    ASSERT_EQ(sb_packbuff_pack_key_with_string_value(pb.get(), 3, "group.a", 4, "/containers/a"), 0);

    for (size_t shift : {size_t{0}, size_t{1}, size_t{4}}) {
        Received in(usedBytes(pb.get()), shift);
        ASSERT_TRUE(in.get());
        int error = -1;
        uint16_t type = 0;
        for (uint32_t v : numbers) {
            ASSERT_TRUE(sb_packbuff_get_item_value_type(in.get(), &type));
            EXPECT_EQ(type, static_cast<uint16_t>(v));
            EXPECT_EQ(sb_packbuff_unpack_uint32(in.get(), &error), v);
            EXPECT_EQ(error, 0);
        }
        for (size_t n = 0; n <= 17; ++n) {
            size_t length = 99;
            ASSERT_TRUE(sb_packbuff_get_item_value_type(in.get(), &type));
            EXPECT_EQ(type, 100 + n);
            const char* s = sb_packbuff_unpack_string(in.get(), &length, &error);
            ASSERT_EQ(error, 0);
            EXPECT_EQ(length, n);
            EXPECT_EQ(std::string(s), text.substr(0, n));
            EXPECT_EQ(in.offset() % 8, 0u);

            ASSERT_TRUE(sb_packbuff_get_item_value_type(in.get(), &type));
            EXPECT_EQ(type, 200 + n);
            const void* b = sb_packbuff_unpack_bytes(in.get(), &length, &error);
            ASSERT_EQ(error, 0);
            ASSERT_EQ(length, n);
            EXPECT_EQ(std::string(static_cast<const char*>(b), length), text.substr(0, n));
        }
        const char* key = nullptr;
        const char* value = nullptr;
        size_t valueLength = 0;
        ASSERT_EQ(sb_packbuff_unpack_key_with_string_value(in.get(), &key, &type, &value, &valueLength), 0);
        EXPECT_STREQ(key, "group.a");
        EXPECT_STREQ(value, "/containers/a");
        EXPECT_EQ(type, 4);
        EXPECT_EQ(valueLength, 13u);
        EXPECT_FALSE(sb_packbuff_get_item_value_type(in.get(), &type));
        EXPECT_EQ(in.offset(), sb_packbuff_get_size(pb.get()) - 8);
        // Nothing reads past the end marker.
        EXPECT_EQ(sb_packbuff_skip_item(in.get()), EINVAL);
        sb_packbuff_unpack_uint32(in.get(), &error);
        EXPECT_EQ(error, EINVAL);
    }
}

TEST(PackbuffReader, WrongTypeLeavesTheCursor) {
    Handle pb(sb_packbuff_new(0));
    sb_packbuff_pack_uint32(pb.get(), 1, 42);
    sb_packbuff_pack_bytes(pb.get(), 2, "xyz", 3);
    sb_packbuff_pack_string(pb.get(), 3, "s", 1);
    sb_packbuff_pack_uint32(pb.get(), 4, 5);
    Received in(usedBytes(pb.get()));
    int error = 0;
    size_t length = 0;
    EXPECT_EQ(sb_packbuff_unpack_string(in.get(), &length, &error), nullptr);
    EXPECT_EQ(error, EINVAL);
    EXPECT_EQ(sb_packbuff_unpack_bytes(in.get(), &length, &error), nullptr);
    EXPECT_EQ(error, EINVAL);
    for (uint16_t notAnItem : {uint16_t{SB_PACKBUFF_ITEM_END}, uint16_t{4}})
        EXPECT_EQ(sb_packbuff_unpack_item(in.get(), notAnItem, nullptr, nullptr, nullptr), EINVAL);
    EXPECT_EQ(in.offset(), 0u);
    EXPECT_EQ(sb_packbuff_unpack_uint32(in.get(), &error), 42u);
    EXPECT_EQ(sb_packbuff_unpack_uint32(in.get(), &error), 0u);
    EXPECT_EQ(error, EINVAL);
    EXPECT_EQ(sb_packbuff_skip_item(in.get()), 0);
    // The key is taken before the value turns out not to be a string.
    const char* key = nullptr;
    uint16_t type = 0;
    EXPECT_EQ(sb_packbuff_unpack_key_with_string_value(in.get(), &key, &type, nullptr, nullptr), EINVAL);
    EXPECT_EQ(type, 4);
    EXPECT_EQ(in.offset(), 40u);
}

TEST(PackbuffReader, RefusesMalformedBuffers) {
    struct Case {
        const char* what;
        std::vector<uint8_t> bytes;
        int error;
    };
    const Case cases[] = {
        {"string without its zero", Bytes().header(2, 1, 3).raw("abc").zeros(5).end().v, EINVAL},
        {"string of length 0", Bytes().header(2, 1, 0).end().v, EINVAL},
        {"payload past the end", Bytes().header(3, 1, 9).raw("12345678").v, ERANGE},
        {"padding past the end", Bytes().header(2, 1, 2).raw("a").zeros(1).v, ERANGE},
        {"no end marker", Bytes().header(2, 1, 2).raw("a").zeros(7).v, ERANGE},
        {"end marker cut short", Bytes().header(1, 1, 1).zeros(4).v, ERANGE},
        {"length wraps 32 bits", Bytes().header(3, 1, 0xFFFFFFFF).end().v, ERANGE},
        {"length just under 4 GiB", Bytes().header(2, 1, 0xFFFFFFF9).end().v, ERANGE},
    };
    for (const Case& c : cases) {
        for (size_t shift : {size_t{0}, size_t{3}}) {
            Received in(c.bytes, shift);
            ASSERT_TRUE(in.get()) << c.what;
            EXPECT_EQ(walk(in.get()), c.error) << c.what;
            EXPECT_EQ(in.offset(), 0u) << c.what;
        }
    }

    // Unknown item types have a value type but no reading; skipping takes them as 8 bytes.
    Received unknown(Bytes().header(4, 77, 0).header(0xFFFF, 1, 16).end().v);
    uint16_t type = 0;
    EXPECT_TRUE(sb_packbuff_get_item_value_type(unknown.get(), &type));
    EXPECT_EQ(type, 77);
    EXPECT_EQ(sb_packbuff_skip_item(unknown.get()), EINVAL);
    EXPECT_EQ(unknown.offset(), 0u);

    // A cursor moved off the buffer is caught before anything is read.
    Received valid(Bytes().header(1, 1, 1).end().v);
    int error = 0;
    for (ptrdiff_t at : {ptrdiff_t{-8}, ptrdiff_t{16}, ptrdiff_t{12}}) {
        valid->item = valid->item_buffer + at;
        sb_packbuff_unpack_uint32(valid.get(), &error);
        EXPECT_EQ(error, ERANGE) << at;
        EXPECT_FALSE(sb_packbuff_get_item_value_type(valid.get(), &type));
    }
    sb_packbuff_unpack_uint32(nullptr, &error);
    EXPECT_EQ(error, EINVAL);
}

TEST(PackbuffReader, EveryTruncationIsRefused) {
    Handle pb(sb_packbuff_new(0));
    sb_packbuff_pack_uint32(pb.get(), 3, 501);
    sb_packbuff_pack_string(pb.get(), 1, "com.example.app", 15);
    sb_packbuff_pack_bytes(pb.get(), 9, "\x01\x02\x03\x04\x05\x06\x07\x08", 8);
    sb_packbuff_pack_key_with_string_value(pb.get(), 4, "g", 7, "");
    const auto whole = usedBytes(pb.get());
    {
        Received in(whole);
        EXPECT_EQ(walk(in.get()), 0);
    }
    for (size_t size = 8; size < whole.size(); ++size) {
        Received in(std::vector<uint8_t>(whole.begin(), whole.begin() + static_cast<ptrdiff_t>(size)));
        EXPECT_EQ(walk(in.get()), ERANGE) << size;
    }
}
