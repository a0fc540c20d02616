#include "packbuff/packbuff_item.h"

#include <limits.h>

static const char *dealloc_name(uint32_t type)
{
    switch (type) {
    case SB_PACKBUFF_DEALLOC_NONE:
        return "None";
    case SB_PACKBUFF_DEALLOC_FREE:
        return "free()";
    case SB_PACKBUFF_DEALLOC_VM:
        return "vm_deallocate()";
    default:
        return "<Unknown>";
    }
}

static void print_item(FILE *out, const uint8_t *at, const sb_packbuff_item *item)
{
    const uint8_t *payload = at + SB_PACKBUFF_ITEM_HEADER_SIZE;
    switch (item->item_type) {
    case SB_PACKBUFF_ITEM_UINT32:
        fprintf(out, "inline value: %u\n", item->value);
        break;
    case SB_PACKBUFF_ITEM_STRING: {
        /* Bounded by the length, so a string without its terminator cannot run on. */
        const int shown = item->value > INT_MAX ? INT_MAX : (int)item->value;
        fprintf(out, "string (%p, %u pad bytes, size: %u): \n     `%.*s'\n", (const void *)payload,
                (unsigned)item->pad, item->value, shown, (const char *)payload);
        break;
    }
    case SB_PACKBUFF_ITEM_BYTES:
        fprintf(out, "bytes (%p, %u pad bytes, size: %u)\n", (const void *)payload, (unsigned)item->pad,
                item->value);
        break;
    default:
        fprintf(out, "*Unknown item type* %u\n", (unsigned)item->item_type);
        break;
    }
}

void sb_packbuff_fprint(const sb_packbuff *pb, FILE *out)
{
    if (pb == NULL)
        return;
    fprintf(out, "packbuff: %p\n", (const void *)pb);
    fprintf(out, "  block_size:      %zu\n", (size_t)pb->block_size);
    fprintf(out, "  dealloc_type:    %s\n", dealloc_name(pb->dealloc_type));
    fprintf(out, "  bytes_allocated: %zu\n", (size_t)pb->bytes_allocated);
    fprintf(out, "  bytes_used:      %zu\n", (size_t)pb->bytes_used);
    fprintf(out, "  bytes_remaining: %zu\n", (size_t)pb->bytes_remaining);
    fprintf(out, "  item_buffer %p, item: %p\n", (const void *)pb->item_buffer, (const void *)pb->item);
    fprintf(out, "\n");

    const uint8_t *base = pb->item_buffer;
    uint64_t limit = pb->bytes_used < pb->bytes_allocated ? pb->bytes_used : pb->bytes_allocated;
    if (base == NULL)
        limit = 0;
    uint64_t offset = 0;
    for (int index = 0;; index++) {
        sb_packbuff_item item;
        if (!sb_packbuff_item_decode(base, limit, offset, &item)) {
            fputs(">> item pointer exceeds end of buffer. <<\n", out);
            return;
        }
        const uint8_t *at = base + offset;
        const char *marker = at == pb->item ? "*" : " ";
        if (item.item_type == SB_PACKBUFF_ITEM_END) {
            fprintf(out, "%s%3d: %p -- END\n", marker, index, (const void *)at);
            return;
        }
        if (item.size > UINTPTR_MAX - (uintptr_t)at) {
            fputs(">> item pointer overflow. <<\n", out);
            return;
        }
        if (item.size > limit - offset) {
            fputs(">> item pointer exceeds end of buffer. <<\n", out);
            return;
        }
        fprintf(out, "%s%3d:%p -- value type %u --", marker, index, (const void *)at, (unsigned)item.value_type);
        print_item(out, at, &item);
        offset += item.size;
    }
}

void sb_packbuff_print(const sb_packbuff *pb)
{
    sb_packbuff_fprint(pb, stdout);
}
