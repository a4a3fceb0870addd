// Digests, HMAC and RSA signature verification over OpenSSL; base64 (Base64.h).
// All functions are pure and thread-safe.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Base64.h"
#include "platform/Result.h"
#include "telvane/Value.h"

namespace telvane::crypto {

Bytes sha1(const std::uint8_t* data, std::size_t size);
Bytes sha256(const std::uint8_t* data, std::size_t size);
inline Bytes sha1(std::string_view s) { return sha1(reinterpret_cast<const std::uint8_t*>(s.data()), s.size()); }
inline Bytes sha256(std::string_view s) { return sha256(reinterpret_cast<const std::uint8_t*>(s.data()), s.size()); }
Bytes hmacSha1(const Bytes& key, const std::uint8_t* data, std::size_t size);
inline Bytes hmacSha1(const Bytes& key, std::string_view s) {
  return hmacSha1(key, reinterpret_cast<const std::uint8_t*>(s.data()), s.size());
}

// Lower-case hexadecimal text of the bytes.
std::string hex(const Bytes& bytes);

// An RSA public key read from DER: SubjectPublicKeyInfo or PKCS#1 RSAPublicKey.
class PublicKey {
 public:
  static Result<PublicKey> fromDer(const Bytes& der);
  PublicKey(PublicKey&&) noexcept;
  PublicKey& operator=(PublicKey&&) noexcept;
  ~PublicKey();

  // Verifies an RSA PKCS#1 v1.5 signature over the SHA-1 digest of the data.
  Status verifySha1(const std::uint8_t* data, std::size_t size, const Bytes& signature) const;

 private:
  explicit PublicKey(void* key) : key_(key) {}
  void* key_ = nullptr;  // EVP_PKEY*
};


}  // namespace telvane::crypto
