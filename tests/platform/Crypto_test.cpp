#include "platform/Crypto.h"

#include <gtest/gtest.h>
#include <openssl/ec.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <string>

namespace telvane::crypto {
namespace {

Bytes bytesOf(std::string_view s) { return Bytes(s.begin(), s.end()); }
std::string textOf(const Bytes& b) { return std::string(b.begin(), b.end()); }

// --- digests and HMAC ---

TEST(CryptoTest, Sha256OfAbc) {
  EXPECT_EQ(hex(sha256("abc")), "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad");
  EXPECT_EQ(hex(sha256("")), "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855");
}

TEST(CryptoTest, Sha1OfAbc) {
  EXPECT_EQ(hex(sha1("abc")), "a9993e364706816aba3e25717850c26c9cd0d89d");
  EXPECT_EQ(hex(sha1("")), "da39a3ee5e6b4b0d3255bfef95601890afd80709");
  EXPECT_EQ(sha1("abc").size(), 20u);
}

TEST(CryptoTest, HexIsLowerCase) {
  EXPECT_EQ(hex(Bytes{0x00, 0x0f, 0xa0, 0xff}), "000fa0ff");
  EXPECT_EQ(hex(Bytes{}), "");
}

struct HmacVector {
  Bytes key;
  Bytes data;
  const char* digest;
};

TEST(CryptoTest, HmacSha1Rfc2202Vectors) {
  Bytes key4;
  for (int i = 1; i <= 25; ++i) key4.push_back(static_cast<std::uint8_t>(i));
  const HmacVector vectors[] = {
      {Bytes(20, 0x0b), bytesOf("Hi There"), "b617318655057264e28bc0b6fb378c8ef146be00"},
      {bytesOf("Jefe"), bytesOf("what do ya want for nothing?"), "effcdf6ae5eb2fa2d27416d5f184df9c259a7c79"},
      {Bytes(20, 0xaa), Bytes(50, 0xdd), "125d7342b9ac11cd91a39af48aa17b4f63f175d3"},
      {key4, Bytes(50, 0xcd), "4c9007f4026250c6bc8414f9bf50c86c2d7235da"},
      {Bytes(20, 0x0c), bytesOf("Test With Truncation"), "4c1a03424b55e07fe7f27be1d58bb9324a9a5a04"},
      {Bytes(80, 0xaa), bytesOf("Test Using Larger Than Block-Size Key - Hash Key First"),
       "aa4ae5e15272d00e95705637ce8a3b55ed402112"},
      {Bytes(80, 0xaa), bytesOf("Test Using Larger Than Block-Size Key and Larger Than One Block-Size Data"),
       "e8e99d0f45237d786d6bbaa7965c7808bbff1a91"},
  };
  int n = 0;
  for (const auto& v : vectors) {
    SCOPED_TRACE(++n);
    EXPECT_EQ(hex(hmacSha1(v.key, v.data.data(), v.data.size())), v.digest);
  }
  EXPECT_EQ(hex(hmacSha1(bytesOf("Jefe"), "what do ya want for nothing?")), "effcdf6ae5eb2fa2d27416d5f184df9c259a7c79");
}

// --- RSA signatures ---

// One RSA key pair for the whole suite: generating it is the slow part.
class CryptoRsaTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { key_ = EVP_RSA_gen(2048); }
  static void TearDownTestSuite() {
    EVP_PKEY_free(key_);
    key_ = nullptr;
  }

  static Bytes subjectPublicKeyInfo(EVP_PKEY* key) {
    unsigned char* der = nullptr;
    int length = i2d_PUBKEY(key, &der);
    Bytes out(der, der + (length > 0 ? length : 0));
    OPENSSL_free(der);
    return out;
  }

  static Bytes pkcs1PublicKey(EVP_PKEY* key) {
    unsigned char* der = nullptr;
    int length = i2d_PublicKey(key, &der);
    Bytes out(der, der + (length > 0 ? length : 0));
    OPENSSL_free(der);
    return out;
  }

  static Bytes signSha1(const Bytes& data) {
    EVP_MD_CTX* ctx = EVP_MD_CTX_new();
    EVP_PKEY_CTX* pctx = nullptr;
    Bytes signature;
    if (EVP_DigestSignInit(ctx, &pctx, EVP_sha1(), nullptr, key_) == 1 &&
        EVP_PKEY_CTX_set_rsa_padding(pctx, RSA_PKCS1_PADDING) > 0) {
      std::size_t length = 0;
      if (EVP_DigestSign(ctx, nullptr, &length, data.data(), data.size()) == 1) {
        signature.resize(length);
        if (EVP_DigestSign(ctx, signature.data(), &length, data.data(), data.size()) == 1) {
          signature.resize(length);
        } else {
          signature.clear();
        }
      }
    }
    EVP_MD_CTX_free(ctx);
    return signature;
  }

  static EVP_PKEY* key_;
};

EVP_PKEY* CryptoRsaTest::key_ = nullptr;

TEST_F(CryptoRsaTest, SignatureVerifiesWithSubjectPublicKeyInfo) {
  ASSERT_NE(key_, nullptr);
  Bytes data = bytesOf("<plist>signed storebag</plist>");
  Bytes signature = signSha1(data);
  ASSERT_EQ(signature.size(), 256u);
  auto key = PublicKey::fromDer(subjectPublicKeyInfo(key_));
  ASSERT_TRUE(key.ok()) << key.error();
  auto status = key->verifySha1(data.data(), data.size(), signature);
  EXPECT_TRUE(status.ok()) << status.error();
}

TEST_F(CryptoRsaTest, SignatureVerifiesWithPkcs1PublicKey) {
  ASSERT_NE(key_, nullptr);
  Bytes data = bytesOf("another document");
  Bytes signature = signSha1(data);
  Bytes pkcs1 = pkcs1PublicKey(key_);
  ASSERT_FALSE(pkcs1.empty());
  ASSERT_NE(pkcs1, subjectPublicKeyInfo(key_));
  auto key = PublicKey::fromDer(pkcs1);
  ASSERT_TRUE(key.ok()) << key.error();
  EXPECT_TRUE(key->verifySha1(data.data(), data.size(), signature).ok());
}

TEST_F(CryptoRsaTest, ChangedDataOrSignatureDoesNotVerify) {
  ASSERT_NE(key_, nullptr);
  Bytes data = bytesOf("the data that was signed");
  Bytes signature = signSha1(data);
  auto key = PublicKey::fromDer(subjectPublicKeyInfo(key_));
  ASSERT_TRUE(key.ok());

  Bytes changedData = data;
  changedData[3] ^= 0x01;
  auto status = key->verifySha1(changedData.data(), changedData.size(), signature);
  EXPECT_FALSE(status.ok());
  EXPECT_EQ(status.error(), "signature does not match");

  Bytes changedSignature = signature;
  changedSignature[100] ^= 0x80;
  EXPECT_FALSE(key->verifySha1(data.data(), data.size(), changedSignature).ok());

  Bytes shortSignature(signature.begin(), signature.end() - 1);
  EXPECT_FALSE(key->verifySha1(data.data(), data.size(), shortSignature).ok());
  EXPECT_FALSE(key->verifySha1(data.data(), data.size(), Bytes{}).ok());

  // The failures above leave nothing behind: no queued OpenSSL errors, and the
  // original still verifies.
  EXPECT_EQ(ERR_peek_error(), 0u);
  EXPECT_TRUE(key->verifySha1(data.data(), data.size(), signature).ok());
}

TEST_F(CryptoRsaTest, SignatureFromAnotherKeyDoesNotVerify) {
  EVP_PKEY* other = EVP_RSA_gen(1024);
  ASSERT_NE(other, nullptr);
  Bytes data = bytesOf("data");
  Bytes signature = signSha1(data);
  auto key = PublicKey::fromDer(subjectPublicKeyInfo(other));
  ASSERT_TRUE(key.ok());
  EXPECT_FALSE(key->verifySha1(data.data(), data.size(), signature).ok());
  EVP_PKEY_free(other);
}

TEST_F(CryptoRsaTest, MovedKeyStillVerifies) {
  Bytes data = bytesOf("moved");
  Bytes signature = signSha1(data);
  auto result = PublicKey::fromDer(subjectPublicKeyInfo(key_));
  ASSERT_TRUE(result.ok());
  PublicKey moved = std::move(result).value();
  EXPECT_TRUE(moved.verifySha1(data.data(), data.size(), signature).ok());
}

TEST(CryptoTest, GarbageDerIsRefused) {
  EXPECT_FALSE(PublicKey::fromDer(Bytes{}).ok());
  EXPECT_FALSE(PublicKey::fromDer(bytesOf("not a key at all")).ok());
  EXPECT_FALSE(PublicKey::fromDer(Bytes{0x30, 0x82, 0x01, 0x22, 0x30}).ok());
  // Nothing is left on the thread's OpenSSL error queue for an unrelated caller.
  EXPECT_EQ(ERR_peek_error(), 0u);
}

TEST_F(CryptoRsaTest, TrailingBytesAfterKeyAreRefused) {
  Bytes der = subjectPublicKeyInfo(key_);
  der.push_back(0x00);
  EXPECT_FALSE(PublicKey::fromDer(der).ok());
}

TEST(CryptoTest, NonRsaKeyIsRefused) {
  EVP_PKEY* ec = EVP_EC_gen("P-256");
  ASSERT_NE(ec, nullptr);
  unsigned char* der = nullptr;
  int length = i2d_PUBKEY(ec, &der);
  ASSERT_GT(length, 0);
  Bytes spki(der, der + length);
  OPENSSL_free(der);
  EVP_PKEY_free(ec);
  auto key = PublicKey::fromDer(spki);
  ASSERT_FALSE(key.ok());
  EXPECT_EQ(key.error(), "public key is not an RSA key");
}

// --- base64 ---

TEST(CryptoTest, Base64EncodesStandardVectors) {
  EXPECT_EQ(base64Encode(bytesOf("")), "");
  EXPECT_EQ(base64Encode(bytesOf("f")), "Zg==");
  EXPECT_EQ(base64Encode(bytesOf("fo")), "Zm8=");
  EXPECT_EQ(base64Encode(bytesOf("foo")), "Zm9v");
  EXPECT_EQ(base64Encode(bytesOf("foob")), "Zm9vYg==");
  EXPECT_EQ(base64Encode(bytesOf("fooba")), "Zm9vYmE=");
  EXPECT_EQ(base64Encode(bytesOf("foobar")), "Zm9vYmFy");
  EXPECT_EQ(base64Encode(Bytes{0xfb, 0xff, 0xbf}), "+/+/");
}

TEST(CryptoTest, Base64DecodeIgnoresLineBreaksBlanksAndJunk) {
  auto r = base64Decode("Zm9v\r\nYm Fy\n");
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(textOf(*r), "foobar");

  r = base64Decode("  Zm*9v~Ym\tE=\n");
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(textOf(*r), "fooba");

  r = base64Decode("Z\x80m\xff" "9v");
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(textOf(*r), "foo");
}

TEST(CryptoTest, Base64DecodeWithoutPaddingDecodesPartialBytes) {
  auto r = base64Decode("Zg");
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(textOf(*r), "f");
  r = base64Decode("Zm8");
  ASSERT_TRUE(r.ok());
  EXPECT_EQ(textOf(*r), "fo");
  r = base64Decode("");
  ASSERT_TRUE(r.ok());
  EXPECT_TRUE(r->empty());
  r = base64Decode("\n==\n");
  ASSERT_TRUE(r.ok());
  EXPECT_TRUE(r->empty());
}

TEST(CryptoTest, Base64DanglingSingleCharacterFails) {
  EXPECT_FALSE(base64Decode("Z").ok());
  EXPECT_FALSE(base64Decode("Zm9vY").ok());
  EXPECT_FALSE(base64Decode("Zm9vY===").ok());
  EXPECT_FALSE(base64Decode("Zm9v\nY\n").ok());
}

TEST(CryptoTest, Base64RoundTripsEveryLengthUpTo64) {
  for (std::size_t length = 0; length <= 64; ++length) {
    SCOPED_TRACE(length);
    Bytes data(length);
    for (std::size_t i = 0; i < length; ++i) data[i] = static_cast<std::uint8_t>(i * 37 + length * 11 + 250);
    std::string text = base64Encode(data);
    EXPECT_EQ(text.size(), (length + 2) / 3 * 4);
    EXPECT_EQ(text.find('\n'), std::string::npos);

    // Same text as OpenSSL's encoder.
    std::string reference((length + 2) / 3 * 4 + 1, '\0');
    int n = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(reference.data()), data.data(), static_cast<int>(length));
    reference.resize(static_cast<std::size_t>(n));
    EXPECT_EQ(text, reference);

    auto decoded = base64Decode(text);
    ASSERT_TRUE(decoded.ok());
    EXPECT_EQ(*decoded, data);

    // Wrapped at 10 characters, as mail and PEM tools do.
    std::string wrapped;
    for (std::size_t i = 0; i < text.size(); ++i) {
      if (i > 0 && i % 10 == 0) wrapped += "\r\n";
      wrapped += text[i];
    }
    decoded = base64Decode(wrapped);
    ASSERT_TRUE(decoded.ok());
    EXPECT_EQ(*decoded, data);
  }
}

}  // namespace
}  // namespace telvane::crypto
