#include "platform/Crypto.h"

#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <array>
#include <cstring>

namespace telvane::crypto {

namespace {

// Takes the reason of the most recent OpenSSL failure and empties the thread's error
// queue, so that a later, unrelated check does not pick up a stale entry.
std::string takeOpenSslError() {
  unsigned long code = ERR_peek_last_error();
  std::string reason;
  if (code != 0) {
    char buf[256];
    ERR_error_string_n(code, buf, sizeof buf);
    reason = buf;
  }
  ERR_clear_error();
  return reason;
}

Bytes digest(const EVP_MD* md, const std::uint8_t* data, std::size_t size) {
  Bytes out(static_cast<std::size_t>(EVP_MD_get_size(md)));
  unsigned int length = 0;
  static const std::uint8_t kEmpty = 0;
  if (EVP_Digest(data ? data : &kEmpty, size, out.data(), &length, md, nullptr) != 1) {
    ERR_clear_error();
    return {};
  }
  out.resize(length);
  return out;
}



}  // namespace

Bytes sha1(const std::uint8_t* data, std::size_t size) { return digest(EVP_sha1(), data, size); }

Bytes sha256(const std::uint8_t* data, std::size_t size) { return digest(EVP_sha256(), data, size); }

Bytes hmacSha1(const Bytes& key, const std::uint8_t* data, std::size_t size) {
  Bytes out(EVP_MAX_MD_SIZE);
  unsigned int length = 0;
  static const std::uint8_t kEmpty = 0;
  // HMAC() is the one-shot EVP-based interface; it is not deprecated in OpenSSL 3.
  if (!HMAC(EVP_sha1(), key.empty() ? &kEmpty : key.data(), static_cast<int>(key.size()), data ? data : &kEmpty,
            size, out.data(), &length)) {
    ERR_clear_error();
    return {};
  }
  out.resize(length);
  return out;
}

std::string hex(const Bytes& bytes) {
  static const char kDigits[] = "0123456789abcdef";
  std::string out;
  out.reserve(bytes.size() * 2);
  for (std::uint8_t b : bytes) {
    out += kDigits[b >> 4];
    out += kDigits[b & 15];
  }
  return out;
}

// --- PublicKey ---

Result<PublicKey> PublicKey::fromDer(const Bytes& der) {
  if (der.empty()) return Result<PublicKey>::failure("empty public key");
  const long length = static_cast<long>(der.size());

  // SubjectPublicKeyInfo first; the whole input must be the one structure.
  const unsigned char* p = der.data();
  EVP_PKEY* key = d2i_PUBKEY(nullptr, &p, length);
  if (key && p != der.data() + der.size()) {
    EVP_PKEY_free(key);
    key = nullptr;
  }
  if (!key) {
    ERR_clear_error();
    // Then a bare PKCS#1 RSAPublicKey.
    p = der.data();
    key = d2i_PublicKey(EVP_PKEY_RSA, nullptr, &p, length);
    if (key && p != der.data() + der.size()) {
      EVP_PKEY_free(key);
      key = nullptr;
    }
  }
  if (!key) {
    std::string reason = takeOpenSslError();
    return Result<PublicKey>::failure("not a DER SubjectPublicKeyInfo or PKCS#1 RSA public key" +
                                      (reason.empty() ? std::string() : " (" + reason + ")"));
  }
  ERR_clear_error();
  if (EVP_PKEY_get_base_id(key) != EVP_PKEY_RSA) {
    EVP_PKEY_free(key);
    return Result<PublicKey>::failure("public key is not an RSA key");
  }
  return Result<PublicKey>::success(PublicKey(key));
}

PublicKey::PublicKey(PublicKey&& other) noexcept : key_(other.key_) { other.key_ = nullptr; }

PublicKey& PublicKey::operator=(PublicKey&& other) noexcept {
  if (this != &other) {
    if (key_) EVP_PKEY_free(static_cast<EVP_PKEY*>(key_));
    key_ = other.key_;
    other.key_ = nullptr;
  }
  return *this;
}

PublicKey::~PublicKey() {
  if (key_) EVP_PKEY_free(static_cast<EVP_PKEY*>(key_));
}

Status PublicKey::verifySha1(const std::uint8_t* data, std::size_t size, const Bytes& signature) const {
  if (!key_) return statusError("no public key");
  if (signature.empty()) return statusError("empty signature");
  EVP_MD_CTX* ctx = EVP_MD_CTX_new();
  if (!ctx) return statusError("out of memory");
  EVP_PKEY_CTX* pkeyCtx = nullptr;  // owned by ctx
  Status result = statusOk();
  static const std::uint8_t kEmpty = 0;
  if (EVP_DigestVerifyInit(ctx, &pkeyCtx, EVP_sha1(), nullptr, static_cast<EVP_PKEY*>(key_)) != 1 ||
      EVP_PKEY_CTX_set_rsa_padding(pkeyCtx, RSA_PKCS1_PADDING) <= 0) {
    result = statusError("cannot set up RSA verification: " + takeOpenSslError());
  } else {
    int rc = EVP_DigestVerify(ctx, signature.data(), signature.size(), data ? data : &kEmpty, size);
    if (rc != 1) {
      std::string reason = takeOpenSslError();
      if (rc == 0) {
        result = statusError("signature does not match");
      } else {
        result = statusError("signature verification failed" + (reason.empty() ? std::string() : ": " + reason));
      }
    }
  }
  EVP_MD_CTX_free(ctx);
  ERR_clear_error();
  return result;
}

}  // namespace telvane::crypto
