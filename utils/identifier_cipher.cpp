#include "utils/identifier_cipher.h"

#include <cstring>

#include <openssl/bio.h>
#include <openssl/crypto.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/pem.h>
#include <openssl/rand.h>

#include "utils/file_util.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

namespace {

// A key file is a few hundred bytes; anything much larger is not one.
constexpr int64_t kMaxKeyFileSize = 64 * 1024;
// Identifiers are short; the bound keeps lengths within libcrypto's int arguments.
constexpr size_t kMaxPlaintext = 1 << 20;

struct PkeyFree {
    void operator()(EVP_PKEY* key) const { EVP_PKEY_free(key); }
};
struct PkeyCtxFree {
    void operator()(EVP_PKEY_CTX* ctx) const { EVP_PKEY_CTX_free(ctx); }
};
struct CipherCtxFree {
    void operator()(EVP_CIPHER_CTX* ctx) const { EVP_CIPHER_CTX_free(ctx); }
};
struct BioFree {
    void operator()(BIO* bio) const { BIO_free(bio); }
};
using Pkey = std::unique_ptr<EVP_PKEY, PkeyFree>;
using PkeyCtx = std::unique_ptr<EVP_PKEY_CTX, PkeyCtxFree>;
using CipherCtx = std::unique_ptr<EVP_CIPHER_CTX, CipherCtxFree>;
using Bio = std::unique_ptr<BIO, BioFree>;

// Key material that is wiped on every way out of its scope.
template <size_t N>
struct Secret {
    uint8_t bytes[N];
    ~Secret() { OPENSSL_cleanse(bytes, N); }
};

// One line per failing step, with libcrypto's error code; never the data.
bool Fail(const char* step) {
    unsigned long error = static_cast<unsigned long>(ERR_get_error());
    ERR_clear_error();
    OLOG_LIMITED_AS(ANDROID_LOG_ERROR, "Seal", "%s %s failed, libcrypto error %lx", step, error);
    return false;
}

// HKDF-SHA256 (RFC 5869) for one 32-byte block: PRK = HMAC(salt, ikm), OKM = HMAC(PRK, info | 1).
// Written on the one-shot HMAC, which OpenSSL and BoringSSL share, unlike their HKDF interfaces.
bool HkdfSha256(const uint8_t* salt, size_t saltSize, const uint8_t* ikm, size_t ikmSize, uint8_t* out) {
    Secret<EVP_MAX_MD_SIZE> prk;
    unsigned int prkSize = 0;
    if (HMAC(EVP_sha256(), salt, saltSize, ikm, ikmSize, prk.bytes, &prkSize) == nullptr) {
        return false;
    }
    uint8_t block[sizeof(IdentifierCipher::kHkdfInfo)];
    memcpy(block, IdentifierCipher::kHkdfInfo, sizeof(block) - 1);
    block[sizeof(block) - 1] = 1;
    unsigned int outSize = 0;
    return HMAC(EVP_sha256(), prk.bytes, prkSize, block, sizeof(block), out, &outSize) != nullptr &&
           outSize == IdentifierCipher::kKeySize;
}

// A fresh key pair: its public half goes to `ephemeralPublic`, and its agreement with the
// server's key, through HKDF, to `aesKey`. The private half never leaves this function.
bool AgreeKey(const uint8_t* serverKey, uint8_t* ephemeralPublic, uint8_t* aesKey) {
    PkeyCtx keygen(EVP_PKEY_CTX_new_id(EVP_PKEY_X25519, nullptr));
    EVP_PKEY* generated = nullptr;
    if (keygen == nullptr || EVP_PKEY_keygen_init(keygen.get()) != 1 ||
        EVP_PKEY_keygen(keygen.get(), &generated) != 1) {
        return Fail("key generation");
    }
    Pkey ephemeral(generated);
    size_t publicSize = IdentifierCipher::kKeySize;
    if (EVP_PKEY_get_raw_public_key(ephemeral.get(), ephemeralPublic, &publicSize) != 1 ||
        publicSize != IdentifierCipher::kKeySize) {
        return Fail("public key");
    }
    Pkey server(EVP_PKEY_new_raw_public_key(EVP_PKEY_X25519, nullptr, serverKey, IdentifierCipher::kKeySize));
    PkeyCtx derive(EVP_PKEY_CTX_new(ephemeral.get(), nullptr));
    Secret<IdentifierCipher::kKeySize> shared;
    size_t sharedSize = sizeof(shared.bytes);
    if (server == nullptr || derive == nullptr || EVP_PKEY_derive_init(derive.get()) != 1 ||
        EVP_PKEY_derive_set_peer(derive.get(), server.get()) != 1 ||
        EVP_PKEY_derive(derive.get(), shared.bytes, &sharedSize) != 1 || sharedSize != sizeof(shared.bytes)) {
        return Fail("key agreement");
    }
    uint8_t salt[2 * IdentifierCipher::kKeySize];
    memcpy(salt, ephemeralPublic, IdentifierCipher::kKeySize);
    memcpy(salt + IdentifierCipher::kKeySize, serverKey, IdentifierCipher::kKeySize);
    if (!HkdfSha256(salt, sizeof(salt), shared.bytes, sizeof(shared.bytes), aesKey)) {
        return Fail("key derivation");
    }
    return true;
}

// AES-256-GCM over the plaintext, with the envelope's header (which holds the nonce) as
// additional data; the ciphertext and the tag follow the header in `envelope`.
bool EncryptGcm(const uint8_t* key, const std::string& plaintext, uint8_t* envelope) {
    const uint8_t* nonce = envelope + 1 + IdentifierCipher::kKeySize;
    uint8_t* ciphertext = envelope + IdentifierCipher::kHeaderSize;
    CipherCtx ctx(EVP_CIPHER_CTX_new());
    int size = 0;
    int written = 0;
    bool ok = ctx != nullptr && EVP_EncryptInit_ex(ctx.get(), EVP_aes_256_gcm(), nullptr, nullptr, nullptr) == 1 &&
              EVP_CIPHER_CTX_ctrl(ctx.get(), EVP_CTRL_GCM_SET_IVLEN, IdentifierCipher::kNonceSize, nullptr) == 1 &&
              EVP_EncryptInit_ex(ctx.get(), nullptr, nullptr, key, nonce) == 1 &&
              EVP_EncryptUpdate(ctx.get(), nullptr, &size, envelope, IdentifierCipher::kHeaderSize) == 1;
    if (ok && !plaintext.empty()) {
        ok = EVP_EncryptUpdate(ctx.get(), ciphertext, &written, reinterpret_cast<const uint8_t*>(plaintext.data()),
                               static_cast<int>(plaintext.size())) == 1;
    }
    ok = ok && EVP_EncryptFinal_ex(ctx.get(), ciphertext + written, &size) == 1 &&
         static_cast<size_t>(written + size) == plaintext.size() &&
         EVP_CIPHER_CTX_ctrl(ctx.get(), EVP_CTRL_GCM_GET_TAG, IdentifierCipher::kTagSize,
                             ciphertext + plaintext.size()) == 1;
    return ok || Fail("encryption");
}

}  // namespace

std::shared_ptr<const IdentifierCipher> IdentifierCipher::FromPem(const std::string& pem) {
    Bio bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    Pkey key(bio == nullptr ? nullptr : PEM_read_bio_PUBKEY(bio.get(), nullptr, nullptr, nullptr));
    std::array<uint8_t, kKeySize> raw{};
    size_t rawSize = raw.size();
    bool ok = key != nullptr && EVP_PKEY_id(key.get()) == EVP_PKEY_X25519 &&
              EVP_PKEY_get_raw_public_key(key.get(), raw.data(), &rawSize) == 1 && rawSize == raw.size();
    ERR_clear_error();
    if (!ok) {
        OLOGE("%s not an X25519 public key in PEM form");
        return nullptr;
    }
    return std::shared_ptr<const IdentifierCipher>(new IdentifierCipher(raw));
}

std::shared_ptr<const IdentifierCipher> IdentifierCipher::FromPemFile(const std::string& path) {
    std::string pem;
    int64_t size = FileUtil::GetFileSize(path);
    if (size <= 0 || size > kMaxKeyFileSize || !FileUtil::LoadStringFromFile(path, pem)) {
        OLOGE("%s no key file %s (size %lld)", path.c_str(), static_cast<long long>(size));
        return nullptr;
    }
    return FromPem(pem);
}

std::string IdentifierCipher::Seal(const std::string& plaintext) const {
    if (plaintext.size() > kMaxPlaintext) {
        OLOGE_LIMITED("%s identifier of %zu bytes refused", plaintext.size());
        return "";
    }
    std::string envelope(kOverhead + plaintext.size(), '\0');
    uint8_t* bytes = reinterpret_cast<uint8_t*>(&envelope[0]);
    bytes[0] = kVersion;
    Secret<kKeySize> aesKey;
    if (!AgreeKey(serverKey_.data(), bytes + 1, aesKey.bytes)) {
        return "";
    }
    if (RAND_bytes(bytes + 1 + kKeySize, kNonceSize) != 1) {
        Fail("nonce");
        return "";
    }
    if (!EncryptGcm(aesKey.bytes, plaintext, bytes)) {
        return "";
    }
    std::string text(SealedSize(plaintext.size()) + 1, '\0');  // EVP_EncodeBlock adds a NUL
    size_t textSize = static_cast<size_t>(
            EVP_EncodeBlock(reinterpret_cast<uint8_t*>(&text[0]), bytes, static_cast<int>(envelope.size())));
    text.resize(textSize);
    return text;
}

}  // namespace Orvane
}  // namespace android
