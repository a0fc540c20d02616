#define _POSIX_C_SOURCE 200809L /* munmap */

#include "packbuff/packbuff_item.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>

/* After a failed reallocation the handle owns nothing and can only be freed:
 * a zero block size makes every later pack fail with ENOTSUP, and a zero
 * capacity makes every unpack fail with ERANGE. */
static void drop_buffer(sb_packbuff *pb)
{
    free(pb->item_buffer);
    pb->item_buffer = NULL;
    pb->item = NULL;
    pb->block_size = 0;
    pb->bytes_allocated = 0;
    pb->bytes_remaining = 0;
    pb->bytes_used = 0;
}

int sb_packbuff_grow(sb_packbuff *pb, uint64_t required)
{
    if (pb->dealloc_type != SB_PACKBUFF_DEALLOC_FREE || pb->block_size == 0)
        return ENOTSUP;

    const uint64_t old_capacity = pb->bytes_allocated;
    bool overflow = pb->block_size > UINT64_MAX - old_capacity || required > UINT64_MAX - 7;
    uint64_t capacity = old_capacity + pb->block_size;
    if (!overflow) {
        const uint64_t required8 = (required + 7) & ~(uint64_t)7;
        if (required8 > capacity - pb->bytes_used) {
            overflow = required8 > UINT64_MAX - capacity;
            capacity += required8;
        }
    }
    uint8_t *grown = overflow || capacity > SIZE_MAX ? NULL : realloc(pb->item_buffer, (size_t)capacity);
    if (grown == NULL) {
        drop_buffer(pb);
        return ENOMEM;
    }
    /* Bytes past the end marker are never written; keep them defined for readers. */
    memset(grown + old_capacity, 0, (size_t)(capacity - old_capacity));
    pb->item_buffer = grown;
    pb->bytes_allocated = capacity;
    pb->bytes_remaining = capacity - pb->bytes_used;
    pb->item = pb->bytes_used == 0 ? grown : grown + (pb->bytes_used - SB_PACKBUFF_ITEM_HEADER_SIZE);
    return 0;
}

sb_packbuff *sb_packbuff_new_with_tag(size_t block_size)
{
    sb_packbuff *pb = calloc(1, sizeof *pb);
    if (pb == NULL)
        return NULL;
    pb->block_size = block_size < BYTE_ALIGNMENT ? SB_PACKBUFF_DEFAULT_BLOCK_SIZE : block_size;
    pb->dealloc_type = SB_PACKBUFF_DEALLOC_FREE;
    if (sb_packbuff_grow(pb, 0) != 0) {
        free(pb);
        return NULL;
    }
    pb->bytes_used = SB_PACKBUFF_ITEM_HEADER_SIZE;
    pb->bytes_remaining -= SB_PACKBUFF_ITEM_HEADER_SIZE;
    pb->item = pb->item_buffer;
    memset(pb->item, 0, SB_PACKBUFF_ITEM_HEADER_SIZE);
    return pb;
}

sb_packbuff *sb_packbuff_new(size_t block_size)
{
    return sb_packbuff_new_with_tag(block_size);
}

sb_packbuff *sb_packbuff_init_with_buffer_and_tag(void *buffer, size_t size, bool holds_data,
                                                  uint32_t dealloc_type)
{
    /* Even an empty packbuff needs its end marker. */
    if (buffer == NULL || size < SB_PACKBUFF_ITEM_HEADER_SIZE)
        return NULL;
    sb_packbuff *pb = calloc(1, sizeof *pb);
    if (pb == NULL)
        return NULL;
    pb->dealloc_type = dealloc_type;
    pb->bytes_allocated = size;
    pb->item_buffer = buffer;
    pb->item = buffer;
    if (holds_data) {
        pb->bytes_used = size;
    } else {
        memset(buffer, 0, SB_PACKBUFF_ITEM_HEADER_SIZE);
        pb->bytes_used = SB_PACKBUFF_ITEM_HEADER_SIZE;
    }
    pb->bytes_remaining = size - pb->bytes_used;
    return pb;
}

sb_packbuff *sb_packbuff_init_with_buffer(void *buffer, size_t size, bool holds_data, uint32_t dealloc_type)
{
    return sb_packbuff_init_with_buffer_and_tag(buffer, size, holds_data, dealloc_type);
}

void sb_packbuff_free(sb_packbuff *pb)
{
    if (pb == NULL)
        return;
    switch (pb->dealloc_type) {
    case SB_PACKBUFF_DEALLOC_VM:
        if (munmap(pb->item_buffer, (size_t)pb->bytes_allocated) != 0)
            fprintf(stderr, "failed: vm_deallocate(%p, %zu)\n", (void *)pb->item_buffer,
                    (size_t)pb->bytes_allocated);
        break;
    case SB_PACKBUFF_DEALLOC_FREE:
        free(pb->item_buffer);
        break;
    default:
        break;
    }
    free(pb);
}

void *sb_packbuff_get_bytes(const sb_packbuff *pb)
{
    return pb == NULL ? NULL : pb->item_buffer;
}

size_t sb_packbuff_get_size(const sb_packbuff *pb)
{
    return pb == NULL ? 0 : (size_t)pb->bytes_used;
}

int sb_packbuff_set_size(sb_packbuff *pb, size_t size)
{
    if (pb == NULL || size < SB_PACKBUFF_ITEM_HEADER_SIZE || size > pb->bytes_allocated)
        return EINVAL;
    pb->bytes_used = size;
    pb->bytes_remaining = pb->bytes_allocated - size;
    return 0;
}
