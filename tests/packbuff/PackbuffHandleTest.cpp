#include "PackbuffTestSupport.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <sys/mman.h>
#include <unistd.h>

using namespace packbuff_test;

TEST(PackbuffHandle, FreeReleasesByDeallocType) {
    const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    void* pages = mmap(nullptr, 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    ASSERT_NE(pages, MAP_FAILED);
    unsigned char residency[2];
    sb_packbuff_free(sb_packbuff_init_with_buffer(pages, page, false, SB_PACKBUFF_DEALLOC_VM));
    errno = 0;
    EXPECT_EQ(mincore(pages, page, residency), -1);
    EXPECT_EQ(errno, ENOMEM);  // the handle's page is gone
    auto* second = static_cast<uint8_t*>(pages) + page;
    EXPECT_EQ(mincore(second, page, residency), 0);  // and only that page

    // A release the system refuses is reported, not fatal.
    testing::internal::CaptureStderr();
    sb_packbuff_free(sb_packbuff_init_with_buffer(second + 8, 16, false, SB_PACKBUFF_DEALLOC_VM));
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              format("failed: vm_deallocate(%p, %zu)\n", static_cast<void*>(second + 8), size_t{16}));
    munmap(second, page);

    uint8_t kept[16] = {1, 2, 3};
    sb_packbuff_free(sb_packbuff_init_with_buffer(kept, sizeof kept, true, SB_PACKBUFF_DEALLOC_NONE));
    EXPECT_EQ(kept[2], 3);
    sb_packbuff_free(nullptr);
}

TEST(PackbuffHandle, SetSizeKeepsTheCountsConsistent) {
    Handle pb(sb_packbuff_new(64));
    EXPECT_EQ(sb_packbuff_set_size(pb.get(), 40), 0);
    EXPECT_EQ(sb_packbuff_get_size(pb.get()), 40u);
    EXPECT_EQ(pb->bytes_remaining, 24u);
    EXPECT_EQ(sb_packbuff_set_size(pb.get(), 65), EINVAL);
    EXPECT_EQ(sb_packbuff_set_size(pb.get(), 7), EINVAL);
    EXPECT_EQ(sb_packbuff_get_size(pb.get()), 40u);
}
