#ifndef ORVANE_UTILS_IDENTIFIER_CIPHER_H
#define ORVANE_UTILS_IDENTIFIER_CIPHER_H

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

namespace android {
namespace Orvane {

// Seals identifiers (serial numbers, account ids) so that only the upload server can read them.
// Every value gets a fresh X25519 key pair, made at run time and forgotten after use; its shared
// secret with the server's public key goes through HKDF-SHA256 to an AES-256-GCM key. The result
// is the Base64 text of the envelope
//
//     version (1 byte, 1) | ephemeral public key (32) | nonce (12) | ciphertext (n) | tag (16)
//
// where the HKDF salt is the ephemeral public key followed by the server's, the HKDF info is
// "orvane identifier v1", and the first 45 bytes (version, key, nonce) are the GCM additional
// data. The same value never gives the same text twice.
//
// Works on libcrypto's EVP interface as both OpenSSL (host) and BoringSSL (device) offer it.
// Neither keys nor plaintexts are ever logged.
//
// Threads: immutable after creation; Seal may run on any number of threads at once.
class IdentifierCipher {
public:
    static constexpr uint8_t kVersion = 1;
    static constexpr size_t kKeySize = 32;
    static constexpr size_t kNonceSize = 12;
    static constexpr size_t kTagSize = 16;
    static constexpr size_t kHeaderSize = 1 + kKeySize + kNonceSize;
    static constexpr size_t kOverhead = kHeaderSize + kTagSize;
    static constexpr char kHkdfInfo[] = "orvane identifier v1";

    // The server's X25519 public key from PEM text ("-----BEGIN PUBLIC KEY-----", text before it
    // is ignored); null, with one error line, for anything else.
    static std::shared_ptr<const IdentifierCipher> FromPem(const std::string& pem);
    // FromPem of a file's text; null, with one error line, when it cannot be read.
    static std::shared_ptr<const IdentifierCipher> FromPemFile(const std::string& path);

    // The Base64 envelope of plaintext; empty on a failure of libcrypto (one limited error line).
    std::string Seal(const std::string& plaintext) const;

    // Base64 text length of the envelope of a plaintext of `size` bytes.
    static size_t SealedSize(size_t size) { return (kOverhead + size + 2) / 3 * 4; }

private:
    explicit IdentifierCipher(const std::array<uint8_t, kKeySize>& serverKey) : serverKey_(serverKey) {}

    const std::array<uint8_t, kKeySize> serverKey_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_IDENTIFIER_CIPHER_H
