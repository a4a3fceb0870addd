// StorebagSigner: the signing side of storebag envelopes, for the tools that make
// storebags (key generation, signing) and for tests. The daemon itself only verifies.
//
// An envelope is a binary property list {"signature": base64, "bag": base64} whose
// bag is a serialised property-list document and whose signature is RSA PKCS#1 v1.5
// over the SHA-1 digest of the bag bytes.
//
// Threading: a signer is immutable after construction; `sign` may be called from any
// thread.
#pragma once

#include <memory>
#include <string>

#include "platform/Result.h"
#include "telvane/Value.h"

namespace telvane {

struct StorebagKeyPair {
  std::string privateKeyPem;  // PKCS#8 PEM
  Bytes publicKeyDer;         // SubjectPublicKeyInfo DER
};

inline constexpr int kStorebagKeyBits = 2048;

// A fresh RSA key pair.
Result<StorebagKeyPair> generateStorebagKeyPair(int bits = kStorebagKeyBits);

class StorebagSigner {
 public:
  // From a PEM private key (PKCS#8 or traditional RSA).
  static Result<StorebagSigner> fromPrivateKeyPem(const std::string& pem);

  // The RSA PKCS#1 v1.5 SHA-1 signature of the bytes.
  Result<Bytes> sign(const Bytes& data) const;
  // The envelope of the bag bytes as a binary property list.
  Result<Bytes> makeEnvelope(const Bytes& bag) const;
  // The envelope of a document, serialised as a binary property list first.
  Result<Bytes> makeEnvelopeForDocument(const Value& document) const;

 private:
  explicit StorebagSigner(std::shared_ptr<void> key) : key_(std::move(key)) {}
  std::shared_ptr<void> key_;  // EVP_PKEY*
};

// Builds an envelope from already encoded parts (the signature and bag texts as
// given), for tools and tests that need unusual envelopes.
Result<Bytes> makeStorebagEnvelope(const std::string& signatureBase64, const std::string& bagBase64);

}  // namespace telvane
