#include "packbuff/packbuff_item.h"

#include <stdlib.h>
#include <string.h>

void sb_packbuff_assert_failed(const char *expr, const char *file, int line)
{
    fprintf(stderr, "%s:%d: packbuff assertion failed: %s\n", file, line, expr);
    abort();
}

/* memcpy keeps loads and stores legal on buffers of any alignment. */
static uint16_t load16(const uint8_t *p)
{
    uint16_t v;
    memcpy(&v, p, sizeof v);
    return v;
}

static uint32_t load32(const uint8_t *p)
{
    uint32_t v;
    memcpy(&v, p, sizeof v);
    return v;
}

bool sb_packbuff_item_decode(const uint8_t *base, uint64_t limit, uint64_t offset,
                             sb_packbuff_item *item)
{
    if (offset > limit || limit - offset < SB_PACKBUFF_ITEM_HEADER_SIZE)
        return false;
    const uint8_t *at = base + offset;
    item->item_type = load16(at);
    item->value_type = load16(at + 2);
    item->value = load32(at + 4);
    if (item->item_type == SB_PACKBUFF_ITEM_STRING || item->item_type == SB_PACKBUFF_ITEM_BYTES) {
        item->pad = sb_packbuff_pad(item->value);
        /* At most 8 + 0xFFFFFFFF + 7: no overflow in 64 bits. */
        item->size = SB_PACKBUFF_ITEM_HEADER_SIZE + (uint64_t)item->value + item->pad;
    } else {
        item->pad = 0;
        item->size = SB_PACKBUFF_ITEM_HEADER_SIZE;
    }
    return true;
}

void sb_packbuff_item_write_header(uint8_t *at, uint16_t item_type, uint16_t value_type, uint32_t value)
{
    memcpy(at, &item_type, sizeof item_type);
    memcpy(at + 2, &value_type, sizeof value_type);
    memcpy(at + 4, &value, sizeof value);
}
