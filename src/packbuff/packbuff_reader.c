#include "packbuff/packbuff_item.h"

#include <errno.h>

/* The bytes come from another party: every header, payload and the word after
 * an item is bounds-checked against the capacity before it is touched, and
 * a refused item leaves the cursor where it was. */

static int locate(const sb_packbuff *pb, sb_packbuff_item *item)
{
    if (pb == NULL)
        return EINVAL;
    const uintptr_t base = (uintptr_t)pb->item_buffer;
    const uintptr_t cursor = (uintptr_t)pb->item;
    if (pb->item_buffer == NULL || cursor < base || cursor - base >= pb->bytes_allocated)
        return ERANGE;
    if (!sb_packbuff_item_decode(pb->item_buffer, pb->bytes_allocated, cursor - base, item))
        return ERANGE;
    return 0;
}

/* The item ends inside the buffer and leaves room for the next header or end marker. */
static int check_advance(const sb_packbuff *pb, const sb_packbuff_item *item)
{
    const uint64_t offset = (uint64_t)(pb->item - pb->item_buffer);
    const uint64_t room = pb->bytes_allocated - offset;
    const uint64_t bytes_to_advance = item->size;
    if (bytes_to_advance > room || room - bytes_to_advance < SB_PACKBUFF_ITEM_HEADER_SIZE)
        return ERANGE;
    SB_PACKBUFF_ASSERT((bytes_to_advance % BYTE_ALIGNMENT) == 0);
    return 0;
}

/* Checks the item under the cursor without moving it. */
static int check_item(const sb_packbuff *pb, uint16_t item_type, sb_packbuff_item *item)
{
    int error = locate(pb, item);
    if (error != 0)
        return error;
    if (item->item_type != item_type)
        return EINVAL;
    return check_advance(pb, item);
}

static void advance(sb_packbuff *pb, const sb_packbuff_item *item)
{
    pb->item += item->size;
}

static void set_error(int *out, int error)
{
    if (out != NULL)
        *out = error;
}

int sb_packbuff_unpack_item(sb_packbuff *pb, uint16_t item_type, uint32_t *value, const void **payload,
                            size_t *length)
{
    if (item_type == SB_PACKBUFF_ITEM_END || item_type > SB_PACKBUFF_ITEM_BYTES)
        return EINVAL;
    sb_packbuff_item item;
    int error = check_item(pb, item_type, &item);
    if (error != 0)
        return error;
    if (item_type == SB_PACKBUFF_ITEM_UINT32) {
        if (value != NULL)
            *value = item.value;
    } else {
        if (payload != NULL)
            *payload = pb->item + SB_PACKBUFF_ITEM_HEADER_SIZE;
        if (length != NULL)
            *length = item.value;
    }
    advance(pb, &item);
    return 0;
}

uint32_t sb_packbuff_unpack_uint32(sb_packbuff *pb, int *error)
{
    uint32_t value = 0;
    set_error(error, sb_packbuff_unpack_item(pb, SB_PACKBUFF_ITEM_UINT32, &value, NULL, NULL));
    return value;
}

const char *sb_packbuff_unpack_string(sb_packbuff *pb, size_t *length, int *error)
{
    uint8_t *before = pb == NULL ? NULL : pb->item;
    const void *payload = NULL;
    size_t size = 0;
    int result = sb_packbuff_unpack_item(pb, SB_PACKBUFF_ITEM_STRING, NULL, &payload, &size);
    /* The terminator travels with the string; without it the item is refused whole. */
    if (result == 0 && (size == 0 || ((const char *)payload)[size - 1] != '\0')) {
        pb->item = before;
        result = EINVAL;
    }
    set_error(error, result);
    if (result != 0)
        return NULL;
    if (length != NULL)
        *length = size - 1;
    return payload;
}

const void *sb_packbuff_unpack_bytes(sb_packbuff *pb, size_t *length, int *error)
{
    const void *payload = NULL;
    int result = sb_packbuff_unpack_item(pb, SB_PACKBUFF_ITEM_BYTES, NULL, &payload, length);
    set_error(error, result);
    return result == 0 ? payload : NULL;
}

int sb_packbuff_unpack_key_with_string_value(sb_packbuff *pb, const char **key, uint16_t *value_type,
                                             const char **value, size_t *value_length)
{
    int error = 0;
    const char *k = sb_packbuff_unpack_string(pb, NULL, &error);
    if (error != 0)
        return error;
    uint16_t type = 0;
    if (sb_packbuff_get_item_value_type(pb, &type) && value_type != NULL)
        *value_type = type;
    const char *v = sb_packbuff_unpack_string(pb, value_length, &error);
    if (error != 0)
        return error;
    if (key != NULL)
        *key = k;
    if (value != NULL)
        *value = v;
    return 0;
}

bool sb_packbuff_get_item_value_type(const sb_packbuff *pb, uint16_t *value_type)
{
    sb_packbuff_item item;
    if (locate(pb, &item) != 0 || item.item_type == SB_PACKBUFF_ITEM_END)
        return false;
    if (value_type != NULL)
        *value_type = item.value_type;
    return true;
}

int sb_packbuff_skip_item(sb_packbuff *pb)
{
    sb_packbuff_item item;
    int error = locate(pb, &item);
    if (error != 0)
        return error;
    if (item.item_type == SB_PACKBUFF_ITEM_END || item.item_type > SB_PACKBUFF_ITEM_BYTES)
        return EINVAL;
    error = check_advance(pb, &item);
    if (error != 0)
        return error;
    advance(pb, &item);
    return 0;
}
