// Digest: the hashes that S3 requests carry, over OpenSSL's one-shot EVP functions.
//
// Stateless free functions; safe to call from any thread. Inputs are byte ranges that must stay
// valid for the call only.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>

namespace digest {

using Sha256 = std::array<uint8_t, 32>;
using Md5 = std::array<uint8_t, 16>;

Sha256 Sha256Of(const void* data, size_t size);
inline Sha256 Sha256Of(const std::string& text) {
    return Sha256Of(text.data(), text.size());
}
Md5 Md5Of(const void* data, size_t size);

// HMAC-SHA256 of `message` under `key` (both raw bytes).
Sha256 HmacSha256(const void* key, size_t keySize, const std::string& message);
inline Sha256 HmacSha256(const std::string& key, const std::string& message) {
    return HmacSha256(key.data(), key.size(), message);
}

// Lower-case hexadecimal, two digits per byte.
std::string Hex(const uint8_t* bytes, size_t size);
template <size_t N>
std::string Hex(const std::array<uint8_t, N>& bytes) {
    return Hex(bytes.data(), N);
}

// Standard base64 with padding (RFC 4648), as Content-MD5 wants it.
std::string Base64(const uint8_t* bytes, size_t size);
template <size_t N>
std::string Base64(const std::array<uint8_t, N>& bytes) {
    return Base64(bytes.data(), N);
}

}  // namespace digest
