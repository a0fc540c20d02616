/*
 * packbuff: the flat, 8-byte-aligned item format of the kernel upcall.
 *
 * A buffer is a run of items, each a multiple of 8 bytes long, closed by an
 * 8-byte word of zeros. Item header (host byte order):
 *   u16 item type | u16 value type | u32 inline value or payload length
 * followed, for strings and bytes, by the payload and zero padding up to the
 * next multiple of 8. The layout is shared with the kernel and must not change.
 *
 * Functions return 0 or a POSIX error number. Unpacked strings and bytes
 * point into the handle's buffer and live as long as it does.
 */
#ifndef PACKBUFF_PACKBUFF_H
#define PACKBUFF_PACKBUFF_H

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>

#ifdef __cplusplus
extern "C" {
#endif

enum {
    SB_PACKBUFF_ITEM_END = 0,
    SB_PACKBUFF_ITEM_UINT32 = 1,
    SB_PACKBUFF_ITEM_STRING = 2,
    SB_PACKBUFF_ITEM_BYTES = 3,
};

/* How sb_packbuff_free releases the buffer. */
enum {
    SB_PACKBUFF_DEALLOC_NONE = 0, /* caller keeps it */
    SB_PACKBUFF_DEALLOC_FREE = 1, /* free(); the only kind that can grow */
    SB_PACKBUFF_DEALLOC_VM = 2,   /* whole pages, unmapped */
};

#define SB_PACKBUFF_ITEM_HEADER_SIZE 8u
#define SB_PACKBUFF_DEFAULT_BLOCK_SIZE 256u

typedef struct sb_packbuff {
    uint32_t dealloc_type;
    uint32_t reserved;
    uint64_t block_size;      /* growth increment */
    uint64_t bytes_allocated; /* capacity */
    uint64_t bytes_remaining; /* capacity - used */
    uint64_t bytes_used;      /* every item plus the end marker */
    uint8_t *item_buffer;
    uint8_t *item; /* next item to read; the end marker while writing */
} sb_packbuff;

/* A growable handle holding an empty packbuff; NULL when memory runs out.
 * A block size below 8 means the default. */
sb_packbuff *sb_packbuff_new_with_tag(size_t block_size);
sb_packbuff *sb_packbuff_new(size_t block_size);

/* A handle over the caller's buffer. With holds_data the whole buffer is taken
 * as packbuff bytes to read; without, an empty packbuff is written into it.
 * NULL for a missing buffer, one too short for an end marker, or no memory. */
sb_packbuff *sb_packbuff_init_with_buffer_and_tag(void *buffer, size_t size, bool holds_data,
                                                  uint32_t dealloc_type);
sb_packbuff *sb_packbuff_init_with_buffer(void *buffer, size_t size, bool holds_data,
                                          uint32_t dealloc_type);

void sb_packbuff_free(sb_packbuff *pb);

void *sb_packbuff_get_bytes(const sb_packbuff *pb);
size_t sb_packbuff_get_size(const sb_packbuff *pb);
/* EINVAL, and nothing changed, for a size below 8 or above the capacity. */
int sb_packbuff_set_size(sb_packbuff *pb, size_t size);

/* Appends one item. `payload` may be NULL only when `length` is 0. */
int sb_packbuff_pack_item(sb_packbuff *pb, uint16_t item_type, uint16_t value_type, uint32_t value,
                          const void *payload, size_t length);
int sb_packbuff_pack_uint32(sb_packbuff *pb, uint16_t value_type, uint32_t value);
/* `length` excludes the terminator, which must be at string[length]. */
int sb_packbuff_pack_string(sb_packbuff *pb, uint16_t value_type, const char *string, size_t length);
int sb_packbuff_pack_bytes(sb_packbuff *pb, uint16_t value_type, const void *data, size_t length);
int sb_packbuff_pack_key_with_string_value(sb_packbuff *pb, uint16_t key_value_type, const char *key,
                                           uint16_t value_value_type, const char *value);

/* Readers leave the cursor where it was on any error. Out parameters may be NULL. */
/* Reads one item of the expected type: its value (type 1) or its payload and length (2, 3). */
int sb_packbuff_unpack_item(sb_packbuff *pb, uint16_t item_type, uint32_t *value, const void **payload,
                            size_t *length);
uint32_t sb_packbuff_unpack_uint32(sb_packbuff *pb, int *error);
const char *sb_packbuff_unpack_string(sb_packbuff *pb, size_t *length, int *error);
const void *sb_packbuff_unpack_bytes(sb_packbuff *pb, size_t *length, int *error);
/* The key string, then the value string; value_type is the value item's tag.
 * When the value is refused the key stays consumed. */
int sb_packbuff_unpack_key_with_string_value(sb_packbuff *pb, const char **key, uint16_t *value_type,
                                             const char **value, size_t *value_length);

/* False at the end marker (or when no item header fits), else true. */
bool sb_packbuff_get_item_value_type(const sb_packbuff *pb, uint16_t *value_type);
int sb_packbuff_skip_item(sb_packbuff *pb);

/* Human-readable dump of the handle and its items. */
void sb_packbuff_print(const sb_packbuff *pb);
void sb_packbuff_fprint(const sb_packbuff *pb, FILE *out);

#ifdef __cplusplus
}
#endif

#endif
