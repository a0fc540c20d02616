#include "PackbuffTestSupport.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>

using namespace packbuff_test;

namespace {

std::string dump(const sb_packbuff* pb) {
    char* text = nullptr;
    size_t size = 0;
    FILE* out = open_memstream(&text, &size);
    sb_packbuff_fprint(pb, out);
    fclose(out);
    std::string result(text, size);
    free(text);
    return result;
}

std::string summary(const sb_packbuff* pb, const char* dealloc) {
    return format("packbuff: %p\n", static_cast<const void*>(pb)) +
           format("  block_size:      %zu\n", static_cast<size_t>(pb->block_size)) +
           format("  dealloc_type:    %s\n", dealloc) +
           format("  bytes_allocated: %zu\n", static_cast<size_t>(pb->bytes_allocated)) +
           format("  bytes_used:      %zu\n", static_cast<size_t>(pb->bytes_used)) +
           format("  bytes_remaining: %zu\n", static_cast<size_t>(pb->bytes_remaining)) +
           format("  item_buffer %p, item: %p\n\n", static_cast<void*>(pb->item_buffer), static_cast<void*>(pb->item));
}

}  // namespace

TEST(PackbuffDump, ListsItemsAndMarksTheCursor) {
    Received in(Bytes()
                    .header(1, 3, 5)
                    .header(2, 1, 3).raw("ab").zeros(6)
                    .header(3, 9, 8).raw("12345678")
                    .header(9, 4, 0)
                    .end()
                    .v);
    ASSERT_EQ(sb_packbuff_skip_item(in.get()), 0);
    const uint8_t* p = in.data();
    const std::string expected =
        summary(in.get(), "None") +
        format("   0:%p -- value type 3 --inline value: 5\n", p) +
        format("*  1:%p -- value type 1 --string (%p, 5 pad bytes, size: 3): \n     `ab'\n", p + 8, p + 16) +
        format("   2:%p -- value type 9 --bytes (%p, 0 pad bytes, size: 8)\n", p + 24, p + 32) +
        format("   3:%p -- value type 4 --*Unknown item type* 9\n", p + 40) +
        format("   4: %p -- END\n", p + 48);
    EXPECT_EQ(dump(in.get()), expected);

    // A writer's cursor rests on the end marker.
    Handle pb(sb_packbuff_new(0));
    const uint8_t* w = pb->item_buffer;
    EXPECT_EQ(dump(pb.get()), summary(pb.get(), "free()") + format("*  0: %p -- END\n", w));
    testing::internal::CaptureStdout();
    sb_packbuff_print(pb.get());
    EXPECT_EQ(testing::internal::GetCapturedStdout(), dump(pb.get()));
}

TEST(PackbuffDump, StopsWhereTheWalkLeavesTheBuffer) {
    Received cut(Bytes().header(1, 3, 5).header(3, 1, 64).zeros(8).v);
    EXPECT_EQ(dump(cut.get()), summary(cut.get(), "None") +
                                   format("*  0:%p -- value type 3 --inline value: 5\n", cut.data()) +
                                   ">> item pointer exceeds end of buffer. <<\n");
    Received unterminated(Bytes().header(1, 3, 5).v);
    EXPECT_NE(dump(unterminated.get()).find(">> item pointer exceeds end of buffer. <<\n"), std::string::npos);

    // A string missing its zero is shown only up to its length.
    Received open(Bytes().header(2, 1, 8).raw("abcdefgh").header(1, 0, 0).end().v);
    EXPECT_NE(dump(open.get()).find("`abcdefgh'\n"), std::string::npos);

    uint8_t buffer[8];
    Handle odd(sb_packbuff_init_with_buffer(buffer, sizeof buffer, false, 7));
    EXPECT_NE(dump(odd.get()).find("  dealloc_type:    <Unknown>\n"), std::string::npos);
}
