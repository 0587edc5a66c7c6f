#include "daemon/DiscoveryContinuation.h"

// Layout: format (1 byte) | run number (8) | position length (u16, little-endian) | position | MAC (16).
// The MAC is HMAC-SHA-256, cut to 16 bytes, over everything before it followed by the binding (connection, uid,
// pid, flags as little-endian integers, then the encoded rules). The run number travels in the clear so that a
// continuation from an earlier run can be told from a forged one; it grants nothing, as the key never leaves bxd.

#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/rand.h>

#include <cstring>

#include "base/Error.h"

namespace bexil {

namespace {

template <typename Integer>
void appendLittleEndian(std::string& out, Integer value) {
    auto bits = static_cast<uint64_t>(value);
    for (size_t i = 0; i < sizeof(Integer); ++i) out += static_cast<char>((bits >> (8 * i)) & 0xff);
}

}  // namespace

DiscoveryContinuation::DiscoveryContinuation() {
    if (RAND_bytes(key_.data(), static_cast<int>(key_.size())) != 1 ||
        RAND_bytes(run_.data(), static_cast<int>(run_.size())) != 1)
        throw InternalInconsistency("no random bytes for the discovery continuation key");
}

DiscoveryContinuation::DiscoveryContinuation(const std::array<uint8_t, kKeyBytes>& key,
                                             const std::array<uint8_t, kRunBytes>& run)
    : key_(key), run_(run) {}

std::array<uint8_t, DiscoveryContinuation::kMacBytes> DiscoveryContinuation::mac(std::string_view signedBytes,
                                                                                 const Binding& binding) const {
    std::string message(signedBytes);
    appendLittleEndian(message, binding.connection);
    appendLittleEndian(message, static_cast<uint32_t>(binding.uid));
    appendLittleEndian(message, static_cast<uint32_t>(binding.pid));
    appendLittleEndian(message, binding.flags);
    message += binding.rules;
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int length = 0;
    if (HMAC(EVP_sha256(), key_.data(), static_cast<int>(key_.size()),
             reinterpret_cast<const unsigned char*>(message.data()), message.size(), digest, &length) == nullptr ||
        length < kMacBytes)
        throw InternalInconsistency("HMAC-SHA-256 failed for a discovery continuation");
    std::array<uint8_t, kMacBytes> out;
    std::memcpy(out.data(), digest, kMacBytes);
    return out;
}

std::string DiscoveryContinuation::issue(std::string_view position, const Binding& binding) const {
    if (position.size() > kMaxPositionBytes) throw InternalInconsistency("discovery position too long to continue");
    std::string bytes;
    bytes.reserve(kFixedBytes + position.size());
    bytes += static_cast<char>(kFormat);
    bytes.append(reinterpret_cast<const char*>(run_.data()), run_.size());
    appendLittleEndian(bytes, static_cast<uint16_t>(position.size()));
    bytes += position;
    std::array<uint8_t, kMacBytes> tag = mac(bytes, binding);
    bytes.append(reinterpret_cast<const char*>(tag.data()), tag.size());
    return bytes;
}

std::variant<std::string, DiscoveryContinuation::Problem> DiscoveryContinuation::read(std::string_view bytes,
                                                                                      const Binding& binding) const {
    if (bytes.size() < kFixedBytes || static_cast<uint8_t>(bytes[0]) != kFormat) return Problem::Malformed;
    size_t length = static_cast<uint8_t>(bytes[1 + kRunBytes]) | (static_cast<uint8_t>(bytes[2 + kRunBytes]) << 8);
    if (bytes.size() != kFixedBytes + length) return Problem::Malformed;
    if (std::memcmp(bytes.data() + 1, run_.data(), kRunBytes) != 0) return Problem::Expired;
    std::string_view signedBytes = bytes.substr(0, bytes.size() - kMacBytes);
    std::array<uint8_t, kMacBytes> expected = mac(signedBytes, binding);
    if (CRYPTO_memcmp(expected.data(), bytes.data() + signedBytes.size(), kMacBytes) != 0) return Problem::Foreign;
    return std::string(bytes.substr(1 + kRunBytes + 2, length));
}

}  // namespace bexil
