// Feeds arbitrary bytes to the packbuff reader, as the upcall server receives them.
// Checks: no read outside the buffer (the copy is exactly the input's size), failed reads
// leave the cursor, yielded payloads lie inside the buffer, and whatever is read packs
// back into a buffer that reads the same.
#include "packbuff/packbuff.h"

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

namespace {

#define REQUIRE(cond) ((cond) ? (void)0 : __builtin_trap())

struct Item {
    int kind;
    uint16_t valueType;
    uint32_t value;
    std::string payload;
    bool operator==(const Item&) const = default;
};

bool inside(const sb_packbuff* pb, const void* p, size_t length) {
    auto* at = static_cast<const uint8_t*>(p);
    return at >= pb->item_buffer && length <= pb->bytes_allocated &&
           static_cast<size_t>(at - pb->item_buffer) <= pb->bytes_allocated - length;
}

// Reads items until none can be read; every reader is tried on every item.
// Returns true when the walk ended on an end marker with every item understood.
bool readAll(sb_packbuff* pb, std::vector<Item>& items) {
    bool understood = true;
    for (;;) {
        uint8_t* before = pb->item;
        uint16_t valueType = 0;
        const bool more = sb_packbuff_get_item_value_type(pb, &valueType);
        int error = -1;
        size_t length = 0;

        uint32_t value = sb_packbuff_unpack_uint32(pb, &error);
        if (error == 0) {
            REQUIRE(more && pb->item == before + 8);
            items.push_back({SB_PACKBUFF_ITEM_UINT32, valueType, value, {}});
            continue;
        }
        REQUIRE(value == 0 && pb->item == before);

        const char* s = sb_packbuff_unpack_string(pb, &length, &error);
        if (error == 0) {
            REQUIRE(more && inside(pb, s, length + 1) && s[length] == '\0');
            REQUIRE(pb->item > before && (pb->item - before) % 8 == 0);
            items.push_back({SB_PACKBUFF_ITEM_STRING, valueType, 0, std::string(s, length)});
            continue;
        }
        REQUIRE(s == nullptr && pb->item == before);

        const void* b = sb_packbuff_unpack_bytes(pb, &length, &error);
        if (error == 0) {
            REQUIRE(more && inside(pb, b, length));
            items.push_back({SB_PACKBUFF_ITEM_BYTES, valueType, 0, std::string(static_cast<const char*>(b), length)});
            continue;
        }
        REQUIRE(b == nullptr && pb->item == before);

        // Left: a string without its terminator, an unknown type, the end, or a broken item.
        if (sb_packbuff_skip_item(pb) == 0) {
            REQUIRE(more && pb->item > before);
            understood = false;
            continue;
        }
        REQUIRE(pb->item == before);
        return understood && !more && inside(pb, before, 8);
    }
}

FILE* sink() {
    static FILE* out = fopen("/dev/null", "w");
    return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    // Exactly the input's size, so any overread is caught; odd sizes also start misaligned.
    const size_t shift = size % 2;
    auto* storage = static_cast<uint8_t*>(malloc(size + shift));
    uint8_t* buffer = storage + shift;
    if (size > 0) memcpy(buffer, data, size);

    sb_packbuff* pb = sb_packbuff_init_with_buffer(buffer, size, true, SB_PACKBUFF_DEALLOC_NONE);
    if (pb == nullptr) {
        REQUIRE(size < 8);
        free(storage);
        return 0;
    }
    sb_packbuff_fprint(pb, sink());

    std::vector<Item> items;
    const bool clean = readAll(pb, items);

    // Pack what was read, with a small block so growth happens, and read it back.
    sb_packbuff* copy = sb_packbuff_new(8 + size % 64);
    REQUIRE(copy != nullptr);
    for (const Item& item : items) {
        int error = item.kind == SB_PACKBUFF_ITEM_UINT32
                        ? sb_packbuff_pack_uint32(copy, item.valueType, item.value)
                    : item.kind == SB_PACKBUFF_ITEM_STRING
                        ? sb_packbuff_pack_string(copy, item.valueType, item.payload.c_str(), item.payload.size())
                        : sb_packbuff_pack_bytes(copy, item.valueType, item.payload.data(), item.payload.size());
        REQUIRE(error == 0);
    }
    sb_packbuff_fprint(copy, sink());
    std::vector<uint8_t> packed(static_cast<uint8_t*>(sb_packbuff_get_bytes(copy)),
                                static_cast<uint8_t*>(sb_packbuff_get_bytes(copy)) + sb_packbuff_get_size(copy));
    sb_packbuff* reread = sb_packbuff_init_with_buffer(packed.data(), packed.size(), true, SB_PACKBUFF_DEALLOC_NONE);
    std::vector<Item> again;
    REQUIRE(readAll(reread, again) && again == items);
    // A cleanly read input is, up to padding contents, the same size as its re-encoding.
    if (clean) REQUIRE(static_cast<size_t>(pb->item - buffer) + 8 == packed.size());
    sb_packbuff_free(reread);
    sb_packbuff_free(copy);

    // Key/value pairs over the same bytes: whatever comes back points into the buffer.
    pb->item = pb->item_buffer;
    for (;;) {
        const char* key = nullptr;
        const char* value = nullptr;
        size_t valueLength = 0;
        uint16_t valueType = 0;
        if (sb_packbuff_unpack_key_with_string_value(pb, &key, &valueType, &value, &valueLength) != 0) break;
        REQUIRE(inside(pb, key, 1) && inside(pb, value, valueLength + 1) && value[valueLength] == '\0');
    }

    sb_packbuff_free(pb);
    free(storage);
    return 0;
}
