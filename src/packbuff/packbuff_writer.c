#include "packbuff/packbuff_item.h"

#include <errno.h>
#include <string.h>

/* Largest padded payload; keeps the item size, header included, inside 32 bits. */
#define MAX_PADDED_PAYLOAD 0xFFFFFFF7u

int sb_packbuff_pack_item(sb_packbuff *pb, uint16_t item_type, uint16_t value_type, uint32_t value,
                          const void *payload, size_t length)
{
    if (pb == NULL)
        return EINVAL;
    if (item_type == SB_PACKBUFF_ITEM_END || item_type > SB_PACKBUFF_ITEM_BYTES)
        return EINVAL;

    const void *additional_bytes = payload;
    const uint64_t extra_bytes_needed = length;
    if (item_type == SB_PACKBUFF_ITEM_UINT32)
        SB_PACKBUFF_ASSERT(extra_bytes_needed == 0);
    else if (extra_bytes_needed > 0)
        SB_PACKBUFF_ASSERT(additional_bytes != NULL);

    if (extra_bytes_needed > MAX_PADDED_PAYLOAD)
        return ERANGE;
    const uint64_t pad = sb_packbuff_pad(extra_bytes_needed);
    if (extra_bytes_needed + pad > MAX_PADDED_PAYLOAD)
        return ERANGE;
    const uint64_t needed = SB_PACKBUFF_ITEM_HEADER_SIZE + extra_bytes_needed + pad;

    if (pb->bytes_remaining < needed) {
        int error = sb_packbuff_grow(pb, needed);
        if (error != 0)
            return error;
    }

    /* The end marker is always the last 8 used bytes; the item replaces it. */
    uint8_t *at = pb->item_buffer + (pb->bytes_used - SB_PACKBUFF_ITEM_HEADER_SIZE);
    if (item_type == SB_PACKBUFF_ITEM_UINT32) {
        sb_packbuff_item_write_header(at, item_type, value_type, value);
    } else {
        sb_packbuff_item_write_header(at, item_type, value_type, (uint32_t)extra_bytes_needed);
        if (extra_bytes_needed > 0)
            memcpy(at + SB_PACKBUFF_ITEM_HEADER_SIZE, additional_bytes, (size_t)extra_bytes_needed);
        memset(at + SB_PACKBUFF_ITEM_HEADER_SIZE + extra_bytes_needed, 0, (size_t)pad);
    }

    pb->bytes_remaining -= needed;
    pb->bytes_used += needed;
    pb->item = at + needed;
    memset(pb->item, 0, SB_PACKBUFF_ITEM_HEADER_SIZE);
    return 0;
}

int sb_packbuff_pack_uint32(sb_packbuff *pb, uint16_t value_type, uint32_t value)
{
    return sb_packbuff_pack_item(pb, SB_PACKBUFF_ITEM_UINT32, value_type, value, NULL, 0);
}

int sb_packbuff_pack_string(sb_packbuff *pb, uint16_t value_type, const char *string, size_t length)
{
    /* The terminator travels with the string and must fit the 32-bit length. */
    if (string == NULL || length > 0xFFFFFFFEu || string[length] != '\0')
        return EINVAL;
    return sb_packbuff_pack_item(pb, SB_PACKBUFF_ITEM_STRING, value_type, 0, string, length + 1);
}

int sb_packbuff_pack_bytes(sb_packbuff *pb, uint16_t value_type, const void *data, size_t length)
{
    if ((uint64_t)length > 0xFFFFFFFFu)
        return EINVAL;
    return sb_packbuff_pack_item(pb, SB_PACKBUFF_ITEM_BYTES, value_type, 0, data, length);
}

int sb_packbuff_pack_key_with_string_value(sb_packbuff *pb, uint16_t key_value_type, const char *key,
                                           uint16_t value_value_type, const char *value)
{
    if (key == NULL || value == NULL)
        return EINVAL;
    int error = sb_packbuff_pack_string(pb, key_value_type, key, strlen(key));
    if (error != 0)
        return error;
    return sb_packbuff_pack_string(pb, value_value_type, value, strlen(value));
}
