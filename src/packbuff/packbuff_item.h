/* Item-level helpers shared by the writer, the reader and the dump. Not for callers. */
#ifndef PACKBUFF_PACKBUFF_ITEM_H
#define PACKBUFF_PACKBUFF_ITEM_H

#include "packbuff/packbuff.h"

#ifdef __cplusplus
extern "C" {
#endif

#define BYTE_ALIGNMENT 8u

/* Checked even in release builds: these mean a caller bug, not bad input. */
#define SB_PACKBUFF_ASSERT(expr) \
    ((expr) ? (void)0 : sb_packbuff_assert_failed(#expr, __FILE__, __LINE__))

void sb_packbuff_assert_failed(const char *expr, const char *file, int line) __attribute__((noreturn));

typedef struct sb_packbuff_item {
    uint16_t item_type;
    uint16_t value_type;
    uint32_t value; /* inline value, or payload length */
    uint64_t pad;   /* payload padding; 0 for inline items */
    uint64_t size;  /* header + payload + padding; 8 for inline and unknown items */
} sb_packbuff_item;

/* Zero padding that follows `length` payload bytes. */
static inline uint64_t sb_packbuff_pad(uint64_t length)
{
    return (BYTE_ALIGNMENT - length % BYTE_ALIGNMENT) % BYTE_ALIGNMENT;
}

/* Decodes the header at `offset` of a `limit`-byte range. Returns false when
 * the 8 header bytes do not fit; the payload is not checked here. */
bool sb_packbuff_item_decode(const uint8_t *base, uint64_t limit, uint64_t offset,
                             sb_packbuff_item *item);

void sb_packbuff_item_write_header(uint8_t *at, uint16_t item_type, uint16_t value_type, uint32_t value);

/* Grows a dealloc-type-1 handle so that `required` more bytes fit. */
int sb_packbuff_grow(sb_packbuff *pb, uint64_t required);

#ifdef __cplusplus
}
#endif

#endif
