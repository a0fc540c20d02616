// SHA-256 and HMAC-SHA256, for the sandbox-extension tokens and the per-root
// semaphore names; small enough that the daemon needs no cryptography library.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace vsl {

using Sha256Digest = std::array<uint8_t, 32>;

Sha256Digest sha256(std::string_view data);
Sha256Digest hmacSha256(std::string_view key, std::string_view message);

// Equal contents, in a time that depends only on the length.
bool constantTimeEqual(std::string_view a, std::string_view b);

}  // namespace vsl
