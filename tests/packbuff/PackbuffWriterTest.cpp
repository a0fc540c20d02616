#include "PackbuffTestSupport.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdint>

using namespace packbuff_test;

// Lets the out-of-memory case below get NULL back from the allocator under ASan.
extern "C" const char* __asan_default_options() { return "allocator_may_return_null=1"; }

namespace {

void expectWriting(const sb_packbuff* pb) {
    EXPECT_EQ(pb->bytes_used + pb->bytes_remaining, pb->bytes_allocated);
    EXPECT_EQ(pb->item, pb->item_buffer + pb->bytes_used - 8);
    EXPECT_EQ(std::vector<uint8_t>(pb->item, pb->item + 8), std::vector<uint8_t>(8, 0));
}

}  // namespace

TEST(PackbuffWriter, ExactBytesOfEachItemKind) {
    Handle pb(sb_packbuff_new(0));
    ASSERT_TRUE(pb);
    EXPECT_EQ(usedBytes(pb.get()), Bytes().end().v);
    expectWriting(pb.get());

    ASSERT_EQ(sb_packbuff_pack_uint32(pb.get(), 3, 5), 0);
    EXPECT_EQ(usedBytes(pb.get()), (std::vector<uint8_t>{1, 0, 3, 0, 5, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0}));

    Handle s(sb_packbuff_new(0));
    ASSERT_EQ(sb_packbuff_pack_string(s.get(), 0x1234, "ab", 2), 0);
    EXPECT_EQ(usedBytes(s.get()), Bytes().header(2, 0x1234, 3).raw("ab").zeros(1 + 5).end().v);

    // Lengths on, one below and one above the 8-byte boundary; an empty string still carries its zero.
    Handle b(sb_packbuff_new(0));
    const std::string data = "0123456789";
    ASSERT_EQ(sb_packbuff_pack_bytes(b.get(), 7, data.data(), 8), 0);
    ASSERT_EQ(sb_packbuff_pack_bytes(b.get(), 8, data.data(), 9), 0);
    ASSERT_EQ(sb_packbuff_pack_bytes(b.get(), 9, data.data(), 7), 0);
    ASSERT_EQ(sb_packbuff_pack_bytes(b.get(), 10, nullptr, 0), 0);
    ASSERT_EQ(sb_packbuff_pack_string(b.get(), 11, "", 0), 0);
    ASSERT_EQ(sb_packbuff_pack_key_with_string_value(b.get(), 3, "grp", 4, "/p"), 0);
    ASSERT_EQ(sb_packbuff_pack_uint32(b.get(), 0xFFFF, 0xFFFFFFFF), 0);
    const auto expected = Bytes()
                              .header(3, 7, 8).raw("01234567")
                              .header(3, 8, 9).raw("012345678").zeros(7)
                              .header(3, 9, 7).raw("0123456").zeros(1)
                              .header(3, 10, 0)
                              .header(2, 11, 1).zeros(8)
                              .header(2, 3, 4).raw("grp").zeros(5)
                              .header(2, 4, 3).raw("/p").zeros(6)
                              .header(1, 0xFFFF, 0xFFFFFFFF)
                              .end()
                              .v;
    EXPECT_EQ(usedBytes(b.get()), expected);
    EXPECT_EQ(sb_packbuff_get_size(b.get()), 16u + 24 + 16 + 8 + 16 + 16 + 16 + 8 + 8);
    expectWriting(b.get());
}

TEST(PackbuffWriter, GrowsByBlocksAndByTheItem) {
    // Block sizes below 8 fall back to the default; 8 itself is honoured.
    for (size_t small : {size_t{0}, size_t{7}}) {
        Handle pb(sb_packbuff_new_with_tag(small));
        ASSERT_TRUE(pb);
        EXPECT_EQ(pb->block_size, 256u);
        EXPECT_EQ(pb->bytes_allocated, 256u);
        EXPECT_EQ(pb->dealloc_type, uint32_t{SB_PACKBUFF_DEALLOC_FREE});
    }
    Handle pb(sb_packbuff_new(8));
    ASSERT_TRUE(pb);
    EXPECT_EQ(pb->bytes_allocated, 8u);
    EXPECT_EQ(pb->bytes_remaining, 0u);
    // 8 needed: one block suffices.
    ASSERT_EQ(sb_packbuff_pack_uint32(pb.get(), 1, 1), 0);
    EXPECT_EQ(pb->bytes_allocated, 16u);
    expectWriting(pb.get());
    // 32 needed, one block leaves 8: the item's own size is added as well.
    ASSERT_EQ(sb_packbuff_pack_bytes(pb.get(), 2, std::string(20, 'x').data(), 20), 0);
    EXPECT_EQ(pb->bytes_allocated, 16u + 8 + 32);
    EXPECT_EQ(pb->bytes_used, 48u);
    expectWriting(pb.get());
    for (uint32_t i = 0; i < 1000; ++i) ASSERT_EQ(sb_packbuff_pack_uint32(pb.get(), 5, i), 0);
    EXPECT_EQ(pb->bytes_used, 48u + 8000);
    expectWriting(pb.get());
}

TEST(PackbuffWriter, CallerBuffersNeverGrow) {
    for (uint32_t type : {uint32_t{SB_PACKBUFF_DEALLOC_NONE}, uint32_t{SB_PACKBUFF_DEALLOC_FREE}}) {
        auto* buffer = static_cast<uint8_t*>(malloc(24));
        std::memset(buffer, 0xAA, 24);
        Handle pb(sb_packbuff_init_with_buffer_and_tag(buffer, 24, false, type));
        ASSERT_TRUE(pb);
        EXPECT_EQ(sb_packbuff_get_size(pb.get()), 8u);
        EXPECT_EQ(pb->bytes_remaining, 16u);
        EXPECT_EQ(std::vector<uint8_t>(buffer, buffer + 8), std::vector<uint8_t>(8, 0));
        ASSERT_EQ(sb_packbuff_pack_uint32(pb.get(), 1, 7), 0);
        ASSERT_EQ(sb_packbuff_pack_uint32(pb.get(), 2, 8), 0);
        const auto before = std::vector<uint8_t>(buffer, buffer + 24);
        EXPECT_EQ(sb_packbuff_pack_uint32(pb.get(), 3, 9), ENOTSUP);
        EXPECT_EQ(sb_packbuff_pack_string(pb.get(), 3, "x", 1), ENOTSUP);
        EXPECT_EQ(std::vector<uint8_t>(buffer, buffer + 24), before);
        EXPECT_EQ(sb_packbuff_get_size(pb.get()), 24u);
        if (type == SB_PACKBUFF_DEALLOC_NONE) {
            pb.reset();
            free(buffer);  // still ours: the handle left it alone
        }
    }
    uint8_t tiny[7];
    EXPECT_EQ(sb_packbuff_init_with_buffer(tiny, sizeof tiny, false, SB_PACKBUFF_DEALLOC_NONE), nullptr);
    EXPECT_EQ(sb_packbuff_init_with_buffer(nullptr, 64, true, SB_PACKBUFF_DEALLOC_NONE), nullptr);
}

TEST(PackbuffWriter, RefusesBadArgumentsWithoutWriting) {
    Handle pb(sb_packbuff_new(0));
    ASSERT_EQ(sb_packbuff_pack_uint32(pb.get(), 1, 1), 0);
    const auto before = usedBytes(pb.get());
    char small[16] = "abc";
    EXPECT_EQ(sb_packbuff_pack_item(pb.get(), SB_PACKBUFF_ITEM_END, 1, 1, nullptr, 0), EINVAL);
    EXPECT_EQ(sb_packbuff_pack_item(pb.get(), 4, 1, 1, small, 1), EINVAL);
    EXPECT_EQ(sb_packbuff_pack_string(pb.get(), 1, small, 2), EINVAL);  // no zero at [2]
    EXPECT_EQ(sb_packbuff_pack_string(pb.get(), 1, nullptr, 0), EINVAL);
    EXPECT_EQ(sb_packbuff_pack_string(pb.get(), 1, small, 0xFFFFFFFFull), EINVAL);
    EXPECT_EQ(sb_packbuff_pack_key_with_string_value(pb.get(), 1, nullptr, 2, "v"), EINVAL);
    // The payload is never read when its size is refused.
    EXPECT_EQ(sb_packbuff_pack_bytes(pb.get(), 1, small, 0x100000000ull), EINVAL);
    EXPECT_EQ(sb_packbuff_pack_bytes(pb.get(), 1, small, 0xFFFFFFFFull), ERANGE);
    EXPECT_EQ(sb_packbuff_pack_bytes(pb.get(), 1, small, 0xFFFFFFF1ull), ERANGE);
    EXPECT_EQ(sb_packbuff_pack_item(pb.get(), 3, 1, 0, small, 0x1000000000ull), ERANGE);
    EXPECT_EQ(usedBytes(pb.get()), before);
    expectWriting(pb.get());
    EXPECT_EQ(sb_packbuff_pack_uint32(nullptr, 1, 1), EINVAL);

    EXPECT_DEATH(sb_packbuff_pack_item(pb.get(), 1, 1, 1, small, 4), "extra_bytes_needed == 0");
    EXPECT_DEATH(sb_packbuff_pack_bytes(pb.get(), 1, nullptr, 4), "additional_bytes != NULL");
}

TEST(PackbuffWriter, OutOfMemoryLeavesAHandleThatCanOnlyBeFreed) {
    EXPECT_EQ(sb_packbuff_new(SIZE_MAX / 2), nullptr);

    Handle pb(sb_packbuff_new(0));
    ASSERT_EQ(sb_packbuff_pack_uint32(pb.get(), 1, 1), 0);
    pb->block_size = UINT64_MAX - 16;  // the next growth cannot be sized
    EXPECT_EQ(sb_packbuff_pack_bytes(pb.get(), 1, std::string(300, 'x').data(), 300), ENOMEM);
    EXPECT_EQ(sb_packbuff_pack_uint32(pb.get(), 1, 1), ENOTSUP);
    int error = 0;
    sb_packbuff_unpack_uint32(pb.get(), &error);
    EXPECT_EQ(error, ERANGE);
}
