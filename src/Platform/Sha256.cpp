#include "Platform/Sha256.h"

#include <cstring>

namespace vsl {

namespace {

constexpr size_t kBlockSize = 64;

constexpr bool isPrime(uint64_t n) {
    for (uint64_t d = 2; d * d <= n; d++)
        if (n % d == 0) return false;
    return n >= 2;
}

// The first 32 bits of the fractional part of n's square (degree 2) or cube (degree 3)
// root: the largest r with r^degree <= n * 2^(32 * degree), by bisection, kept mod 2^32.
constexpr uint32_t rootFraction(uint64_t n, int degree) {
    const unsigned __int128 target = static_cast<unsigned __int128>(n) << (32 * degree);
    uint64_t lo = 0, hi = uint64_t(1) << 36;
    while (lo + 1 < hi) {
        const uint64_t mid = lo + (hi - lo) / 2;
        unsigned __int128 power = 1;
        for (int i = 0; i < degree; i++) power *= mid;
        if (power <= target) lo = mid;
        else hi = mid;
    }
    return static_cast<uint32_t>(lo);
}

template <size_t N>
constexpr std::array<uint32_t, N> primeRootFractions(int degree) {
    std::array<uint32_t, N> out{};
    size_t found = 0;
    for (uint64_t n = 2; found < N; n++)
        if (isPrime(n)) out[found++] = rootFraction(n, degree);
    return out;
}

// Cube roots of the first 64 primes, square roots of the first 8.
constexpr std::array<uint32_t, 64> kRound = primeRootFractions<64>(3);
constexpr std::array<uint32_t, 8> kInitial = primeRootFractions<8>(2);

constexpr uint32_t rotr(uint32_t x, int n) { return (x >> n) | (x << (32 - n)); }

class Sha256 {
public:
    void update(std::string_view data) {
        length_ += data.size();
        for (unsigned char c : data) {
            block_[used_++] = c;
            if (used_ == kBlockSize) {
                compress();
                used_ = 0;
            }
        }
    }

    Sha256Digest finish() {
        const uint64_t bits = length_ * 8;
        block_[used_++] = 0x80;
        if (used_ > kBlockSize - 8) {
            std::memset(block_ + used_, 0, kBlockSize - used_);
            compress();
            used_ = 0;
        }
        std::memset(block_ + used_, 0, kBlockSize - 8 - used_);
        for (int i = 0; i < 8; i++) block_[kBlockSize - 1 - i] = static_cast<uint8_t>(bits >> (8 * i));
        compress();
        Sha256Digest out;
        for (size_t i = 0; i < 8; i++)
            for (size_t j = 0; j < 4; j++) out[4 * i + j] = static_cast<uint8_t>(state_[i] >> (24 - 8 * j));
        return out;
    }

private:
    void compress() {
        uint32_t w[64];
        for (size_t t = 0; t < 16; t++)
            w[t] = uint32_t(block_[4 * t]) << 24 | uint32_t(block_[4 * t + 1]) << 16 |
                   uint32_t(block_[4 * t + 2]) << 8 | uint32_t(block_[4 * t + 3]);
        for (size_t t = 16; t < 64; t++) {
            const uint32_t s0 = rotr(w[t - 15], 7) ^ rotr(w[t - 15], 18) ^ (w[t - 15] >> 3);
            const uint32_t s1 = rotr(w[t - 2], 17) ^ rotr(w[t - 2], 19) ^ (w[t - 2] >> 10);
            w[t] = w[t - 16] + s0 + w[t - 7] + s1;
        }
        uint32_t a = state_[0], b = state_[1], c = state_[2], d = state_[3];
        uint32_t e = state_[4], f = state_[5], g = state_[6], h = state_[7];
        for (size_t t = 0; t < 64; t++) {
            const uint32_t t1 = h + (rotr(e, 6) ^ rotr(e, 11) ^ rotr(e, 25)) + ((e & f) ^ (~e & g)) + kRound[t] + w[t];
            const uint32_t t2 = (rotr(a, 2) ^ rotr(a, 13) ^ rotr(a, 22)) + ((a & b) ^ (a & c) ^ (b & c));
            h = g;
            g = f;
            f = e;
            e = d + t1;
            d = c;
            c = b;
            b = a;
            a = t1 + t2;
        }
        state_[0] += a;
        state_[1] += b;
        state_[2] += c;
        state_[3] += d;
        state_[4] += e;
        state_[5] += f;
        state_[6] += g;
        state_[7] += h;
    }

    std::array<uint32_t, 8> state_ = kInitial;
    uint8_t block_[kBlockSize] = {};
    size_t used_ = 0;
    uint64_t length_ = 0;
};

std::string_view view(const uint8_t* p, size_t n) { return {reinterpret_cast<const char*>(p), n}; }

}  // namespace

Sha256Digest sha256(std::string_view data) {
    Sha256 hash;
    hash.update(data);
    return hash.finish();
}

Sha256Digest hmacSha256(std::string_view key, std::string_view message) {
    uint8_t padded[kBlockSize] = {};
    if (key.size() > kBlockSize) {
        const Sha256Digest short_key = sha256(key);
        std::memcpy(padded, short_key.data(), short_key.size());
    } else {
        std::memcpy(padded, key.data(), key.size());
    }
    uint8_t pad[kBlockSize];
    for (size_t i = 0; i < kBlockSize; i++) pad[i] = padded[i] ^ 0x36;
    Sha256 inner;
    inner.update(view(pad, kBlockSize));
    inner.update(message);
    const Sha256Digest innerDigest = inner.finish();
    for (size_t i = 0; i < kBlockSize; i++) pad[i] = padded[i] ^ 0x5c;
    Sha256 outer;
    outer.update(view(pad, kBlockSize));
    outer.update(view(innerDigest.data(), innerDigest.size()));
    return outer.finish();
}

bool constantTimeEqual(std::string_view a, std::string_view b) {
    if (a.size() != b.size()) return false;
    volatile uint8_t diff = 0;
    for (size_t i = 0; i < a.size(); i++) diff = diff | (static_cast<uint8_t>(a[i]) ^ static_cast<uint8_t>(b[i]));
    return diff == 0;
}

}  // namespace vsl
