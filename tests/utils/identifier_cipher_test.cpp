#include "utils/identifier_cipher.h"

#include <atomic>
#include <thread>
#include <vector>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/envelope_opener.h"
#include "tests/common/log_capture.h"

namespace android::Orvane {
namespace {

// Only the holder of the server's private key reads what was sealed; every sealing of the same
// value differs; a changed byte anywhere, or another server key, opens nothing; lengths follow
// the documented envelope, from the empty value to one with NULs and invalid UTF-8.
TEST(IdentifierCipherTest, OnlyTheServerKeyOpensAndEveryEnvelopeIsFresh) {
    std::string publicPem, privatePem, otherPublic, otherPrivate;
    EnvelopeOpener::MakeKeyPair(publicPem, privatePem);
    EnvelopeOpener::MakeKeyPair(otherPublic, otherPrivate);
    std::shared_ptr<const IdentifierCipher> cipher = IdentifierCipher::FromPem("a note first\n" + publicPem);
    ASSERT_NE(cipher, nullptr);
    EnvelopeOpener server(privatePem), stranger(otherPrivate);

    const std::string values[] = {"", "SN0123456789", std::string("a\0b\xff\xfe", 5), std::string(5000, 'x')};
    for (const std::string& value : values) {
        std::string sealed = cipher->Seal(value);
        EXPECT_EQ(sealed.size(), IdentifierCipher::SealedSize(value.size()));
        EXPECT_EQ(sealed.find_first_not_of("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/="),
                  std::string::npos);
        std::string opened;
        ASSERT_TRUE(server.Open(sealed, opened));
        EXPECT_EQ(opened, value);
        EXPECT_FALSE(stranger.Open(sealed, opened));
        EXPECT_NE(cipher->Seal(value), sealed);
        // A flipped bit in the version, the key, the nonce, the ciphertext or the tag.
        for (size_t at : {size_t{1}, size_t{10}, size_t{50}, sealed.size() / 2, sealed.size() - 5}) {
            std::string tampered = sealed;
            tampered[at] = tampered[at] == 'A' ? 'B' : 'A';
            EXPECT_FALSE(server.Open(tampered, opened)) << "changed at " << at;
        }
    }
    EXPECT_EQ(IdentifierCipher::SealedSize(12), 100u);  // 73 bytes of envelope
}

// Keys that are not an X25519 public key are refused with one error line, and nothing of the
// key's text reaches the log; a key file is read once, from its file.
TEST(IdentifierCipherTest, RefusesAnythingButAnX25519PublicKey) {
    std::string publicPem, privatePem;
    EnvelopeOpener::MakeKeyPair(publicPem, privatePem);
    EVP_PKEY* ec = nullptr;
    EVP_PKEY_CTX* ctx = EVP_PKEY_CTX_new_id(EVP_PKEY_EC, nullptr);
    ASSERT_TRUE(EVP_PKEY_keygen_init(ctx) == 1 &&
                EVP_PKEY_CTX_set_ec_paramgen_curve_nid(ctx, NID_X9_62_prime256v1) == 1 &&
                EVP_PKEY_keygen(ctx, &ec) == 1);
    EVP_PKEY_CTX_free(ctx);
    BIO* bio = BIO_new(BIO_s_mem());
    PEM_write_bio_PUBKEY(bio, ec);
    char* data = nullptr;
    long size = BIO_get_mem_data(bio, &data);
    std::string ecPem(data, static_cast<size_t>(size));
    BIO_free(bio);
    EVP_PKEY_free(ec);

    LogCapture capture;
    for (const std::string& bad : {std::string(), std::string("junk"), privatePem, ecPem,
                                   publicPem.substr(0, publicPem.size() / 2), std::string(100000, '-')}) {
        EXPECT_EQ(IdentifierCipher::FromPem(bad), nullptr);
    }
    EXPECT_EQ(capture.Count(ANDROID_LOG_ERROR, "not an X25519 public key"), 6u);
    std::string body = privatePem.substr(privatePem.find('\n') + 1, 20);
    EXPECT_EQ(capture.Dump().find(body), std::string::npos);

    TemporaryDir dir;
    std::string path = std::string(dir.path) + "/key.pem";
    EXPECT_EQ(IdentifierCipher::FromPemFile(path), nullptr);
    ASSERT_TRUE(android::base::WriteStringToFile(publicPem, path));
    EXPECT_NE(IdentifierCipher::FromPemFile(path), nullptr);
    ASSERT_TRUE(android::base::WriteStringToFile(std::string(70 * 1024, 'k'), path));
    EXPECT_EQ(IdentifierCipher::FromPemFile(path), nullptr);
}

// One cipher seals on many threads at once (the compliance plugin and later the event-info
// records share it); every envelope opens to its own value.
TEST(IdentifierCipherTest, SealsConcurrently) {
    std::string publicPem, privatePem;
    EnvelopeOpener::MakeKeyPair(publicPem, privatePem);
    std::shared_ptr<const IdentifierCipher> cipher = IdentifierCipher::FromPem(publicPem);
    ASSERT_NE(cipher, nullptr);
    EnvelopeOpener server(privatePem);
    std::atomic<int> opened{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < 50; ++i) {
                std::string value = "id-" + std::to_string(t * 100 + i), plain;
                opened += server.Open(cipher->Seal(value), plain) && plain == value ? 1 : 0;
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(opened, 200);
}

}  // namespace
}  // namespace android::Orvane
