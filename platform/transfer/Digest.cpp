#include "platform/transfer/Digest.h"

#include <openssl/evp.h>
#include <openssl/hmac.h>

#include <stdexcept>

namespace digest {

namespace {
template <size_t N>
std::array<uint8_t, N> EvpDigest(const EVP_MD* md, const void* data, size_t size) {
    std::array<uint8_t, N> out{};
    unsigned int length = 0;
    // Fails only when OpenSSL cannot allocate; there is no sensible digest to return then.
    if (EVP_Digest(data, size, out.data(), &length, md, nullptr) != 1 || length != N) {
        throw std::runtime_error("EVP_Digest failed");
    }
    return out;
}
}  // namespace

Sha256 Sha256Of(const void* data, size_t size) {
    return EvpDigest<32>(EVP_sha256(), data, size);
}

Md5 Md5Of(const void* data, size_t size) {
    return EvpDigest<16>(EVP_md5(), data, size);
}

Sha256 HmacSha256(const void* key, size_t keySize, const std::string& message) {
    Sha256 out{};
    unsigned int length = 0;
    if (HMAC(EVP_sha256(), key, static_cast<int>(keySize),
             reinterpret_cast<const unsigned char*>(message.data()), message.size(), out.data(),
             &length) == nullptr ||
        length != out.size()) {
        throw std::runtime_error("HMAC failed");
    }
    return out;
}

std::string Hex(const uint8_t* bytes, size_t size) {
    static const char kDigits[] = "0123456789abcdef";
    std::string out;
    out.reserve(size * 2);
    for (size_t i = 0; i < size; ++i) {
        out.push_back(kDigits[bytes[i] >> 4]);
        out.push_back(kDigits[bytes[i] & 0x0f]);
    }
    return out;
}

std::string Base64(const uint8_t* bytes, size_t size) {
    // EVP_EncodeBlock writes a terminating NUL after the text: one byte more than the result.
    std::string out(4 * ((size + 2) / 3) + 1, '\0');
    int written =
        EVP_EncodeBlock(reinterpret_cast<unsigned char*>(&out[0]), bytes, static_cast<int>(size));
    out.resize(written < 0 ? 0 : static_cast<size_t>(written));
    return out;
}

}  // namespace digest
