#pragma once

#include "packbuff/packbuff.h"

#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

namespace packbuff_test {

// Hand-assembled packbuff bytes (little-endian), so the reader can be fed what no writer makes.
struct Bytes {
    std::vector<uint8_t> v;
    Bytes& u8(uint8_t b) {
        v.push_back(b);
        return *this;
    }
    Bytes& u16(uint16_t x) { return u8(x & 0xFF).u8(x >> 8); }
    Bytes& u32(uint32_t x) { return u16(x & 0xFFFF).u16(x >> 16); }
    Bytes& header(uint16_t itemType, uint16_t valueType, uint32_t value) {
        return u16(itemType).u16(valueType).u32(value);
    }
    Bytes& raw(const std::string& s) {
        v.insert(v.end(), s.begin(), s.end());
        return *this;
    }
    Bytes& zeros(size_t n) {
        v.insert(v.end(), n, 0);
        return *this;
    }
    Bytes& end() { return zeros(8); }
};

struct HandleDeleter {
    void operator()(sb_packbuff* pb) const { sb_packbuff_free(pb); }
};
using Handle = std::unique_ptr<sb_packbuff, HandleDeleter>;

// printf-style, for expected lines that hold pointers.
inline std::string format(const char* fmt, ...) {
    char line[512];
    va_list args;
    va_start(args, fmt);
    vsnprintf(line, sizeof line, fmt, args);
    va_end(args);
    return line;
}

inline std::vector<uint8_t> usedBytes(const sb_packbuff* pb) {
    auto* p = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb));
    return {p, p + sb_packbuff_get_size(pb)};
}

// A read handle over a heap copy of exactly `bytes.size()` bytes placed `shift` bytes into its
// allocation: the sanitizer sees any read past the end, and a non-zero shift misaligns the start.
class Received {
public:
    explicit Received(const std::vector<uint8_t>& bytes, size_t shift = 0)
        : storage_(new uint8_t[bytes.size() + shift]), data_(storage_.get() + shift) {
        if (!bytes.empty()) std::memcpy(data_, bytes.data(), bytes.size());
        handle_.reset(sb_packbuff_init_with_buffer(data_, bytes.size(), true, SB_PACKBUFF_DEALLOC_NONE));
    }
    sb_packbuff* get() const { return handle_.get(); }
    sb_packbuff* operator->() const { return handle_.get(); }
    const uint8_t* data() const { return data_; }
    size_t offset() const { return static_cast<size_t>(handle_->item - data_); }

private:
    std::unique_ptr<uint8_t[]> storage_;
    uint8_t* data_;
    Handle handle_;  // declared last: released before the storage it points into
};

}  // namespace packbuff_test
