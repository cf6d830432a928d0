#ifndef ORVANE_TESTS_COMMON_ENVELOPE_OPENER_H
#define ORVANE_TESTS_COMMON_ENVELOPE_OPENER_H

#include <cstring>
#include <memory>
#include <string>

#include <openssl/bio.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#if defined(OPENSSL_IS_BORINGSSL)
#include <openssl/hkdf.h>
#else
#include <openssl/kdf.h>
#endif

namespace android::Orvane {

// The upload server's side of identifier envelopes, written apart from the daemon's code (on
// the library's own HKDF) so that a test opening an envelope checks the format, not the code twice:
// Base64 of version 1 | ephemeral X25519 key (32) | nonce (12) | ciphertext | tag (16), key =
// HKDF-SHA256(salt = ephemeral key | server key, info = "orvane identifier v1"), the first 45
// bytes authenticated.
class EnvelopeOpener {
public:
    // A fresh server key pair, both halves as PEM.
    static void MakeKeyPair(std::string& publicPem, std::string& privatePem) {
        EVP_PKEY* key = nullptr;
        EVP_PKEY_CTX* ctx = EVP_PKEY_CTX_new_id(EVP_PKEY_X25519, nullptr);
        EVP_PKEY_keygen_init(ctx);
        EVP_PKEY_keygen(ctx, &key);
        EVP_PKEY_CTX_free(ctx);
        BIO* pub = BIO_new(BIO_s_mem());
        BIO* priv = BIO_new(BIO_s_mem());
        PEM_write_bio_PUBKEY(pub, key);
        PEM_write_bio_PrivateKey(priv, key, nullptr, nullptr, 0, nullptr, nullptr);
        publicPem = Drain(pub);
        privatePem = Drain(priv);
        EVP_PKEY_free(key);
    }

    explicit EnvelopeOpener(const std::string& privatePem) {
        BIO* bio = BIO_new_mem_buf(privatePem.data(), static_cast<int>(privatePem.size()));
        key_ = PEM_read_bio_PrivateKey(bio, nullptr, nullptr, nullptr);
        BIO_free(bio);
    }
    ~EnvelopeOpener() { EVP_PKEY_free(key_); }

    // The plaintext, or false when the text is no envelope this key opens.
    bool Open(const std::string& base64, std::string& plaintext) const {
        std::string envelope;
        if (key_ == nullptr || !Decode(base64, envelope) || envelope.size() < 61 || envelope[0] != 1) {
            return false;
        }
        const auto* bytes = reinterpret_cast<const unsigned char*>(envelope.data());
        unsigned char aesKey[32];
        if (!DeriveKey(bytes + 1, aesKey)) {
            return false;
        }
        size_t size = envelope.size() - 61;
        plaintext.assign(size, '\0');
        EVP_CIPHER_CTX* ctx = EVP_CIPHER_CTX_new();
        int len = 0;
        bool ok = EVP_DecryptInit_ex(ctx, EVP_aes_256_gcm(), nullptr, nullptr, nullptr) == 1 &&
                  EVP_CIPHER_CTX_ctrl(ctx, EVP_CTRL_GCM_SET_IVLEN, 12, nullptr) == 1 &&
                  EVP_DecryptInit_ex(ctx, nullptr, nullptr, aesKey, bytes + 33) == 1 &&
                  EVP_DecryptUpdate(ctx, nullptr, &len, bytes, 45) == 1 &&
                  EVP_DecryptUpdate(ctx, reinterpret_cast<unsigned char*>(&plaintext[0]), &len, bytes + 45,
                                    static_cast<int>(size)) == 1 &&
                  EVP_CIPHER_CTX_ctrl(ctx, EVP_CTRL_GCM_SET_TAG, 16, const_cast<unsigned char*>(bytes + 45 + size)) ==
                          1 &&
                  EVP_DecryptFinal_ex(ctx, reinterpret_cast<unsigned char*>(&plaintext[0]) + len, &len) == 1;
        EVP_CIPHER_CTX_free(ctx);
        return ok;
    }

private:
    static std::string Drain(BIO* bio) {
        char* data = nullptr;
        long size = BIO_get_mem_data(bio, &data);
        std::string text(data, static_cast<size_t>(size));
        BIO_free(bio);
        return text;
    }

    static bool Decode(const std::string& base64, std::string& out) {
        if (base64.empty() || base64.size() % 4 != 0) {
            return false;
        }
        out.assign(base64.size() / 4 * 3, '\0');
        int size =
                EVP_DecodeBlock(reinterpret_cast<unsigned char*>(&out[0]),
                                reinterpret_cast<const unsigned char*>(base64.data()), static_cast<int>(base64.size()));
        if (size < 0) {
            return false;
        }
        size_t padding = base64[base64.size() - 1] == '=' ? (base64[base64.size() - 2] == '=' ? 2 : 1) : 0;
        out.resize(static_cast<size_t>(size) - padding);
        return true;
    }

    bool DeriveKey(const unsigned char* ephemeralPublic, unsigned char* aesKey) const {
        unsigned char salt[64];
        size_t serverSize = 32;
        memcpy(salt, ephemeralPublic, 32);
        EVP_PKEY_get_raw_public_key(key_, salt + 32, &serverSize);
        EVP_PKEY* ephemeral = EVP_PKEY_new_raw_public_key(EVP_PKEY_X25519, nullptr, ephemeralPublic, 32);
        EVP_PKEY_CTX* derive = EVP_PKEY_CTX_new(key_, nullptr);
        unsigned char shared[32];
        size_t sharedSize = sizeof(shared);
        bool ok = ephemeral != nullptr && EVP_PKEY_derive_init(derive) == 1 &&
                  EVP_PKEY_derive_set_peer(derive, ephemeral) == 1 && EVP_PKEY_derive(derive, shared, &sharedSize) == 1;
        EVP_PKEY_CTX_free(derive);
        EVP_PKEY_free(ephemeral);
        static const char kInfo[] = "orvane identifier v1";
        const auto* info = reinterpret_cast<const unsigned char*>(kInfo);
#if defined(OPENSSL_IS_BORINGSSL)
        ok = ok &&
             HKDF(aesKey, 32, EVP_sha256(), shared, sizeof(shared), salt, sizeof(salt), info, sizeof(kInfo) - 1) == 1;
#else
        EVP_PKEY_CTX* hkdf = EVP_PKEY_CTX_new_id(EVP_PKEY_HKDF, nullptr);
        size_t keySize = 32;
        ok = ok && EVP_PKEY_derive_init(hkdf) == 1 && EVP_PKEY_CTX_set_hkdf_md(hkdf, EVP_sha256()) == 1 &&
             EVP_PKEY_CTX_set1_hkdf_salt(hkdf, salt, sizeof(salt)) == 1 &&
             EVP_PKEY_CTX_set1_hkdf_key(hkdf, shared, sizeof(shared)) == 1 &&
             EVP_PKEY_CTX_add1_hkdf_info(hkdf, info, sizeof(kInfo) - 1) == 1 &&
             EVP_PKEY_derive(hkdf, aesKey, &keySize) == 1;
        EVP_PKEY_CTX_free(hkdf);
#endif
        return ok;
    }

    EVP_PKEY* key_ = nullptr;
};

}  // namespace android::Orvane

#endif  // ORVANE_TESTS_COMMON_ENVELOPE_OPENER_H
