// StorebagEnvelope: the check of a signed storebag envelope, from the bytes the server
// sent (or the disk cache kept) to the macro-expanded document.
//
// The envelope is a property list (any format) {"signature", "bag"}, both base64
// text (characters outside the alphabet are ignored). The signature is RSA PKCS#1
// v1.5 over the SHA-1 digest of the decoded bag bytes, checked with the deployment's
// public key (DER), which is read afresh for every check. The bag is itself a
// property list: the storebag document.
//
// `checkStorebagEnvelope` performs the steps without logging, for tools; the
// StorebagVerifier logs the daemon's lines, saves good envelopes to the disk cache
// when asked and applies the shared values.
//
// Threading: everything here is safe from any thread; the verifier is immutable and
// the disk cache synchronises through the file system (callers hold storebagLock()).
#pragma once

#include <functional>
#include <optional>
#include <string>

#include "platform/Crypto.h"
#include "storebag/StorebagDiskCache.h"
#include "telvane/Value.h"

namespace telvane {

inline constexpr const char* kEnvelopeKeySignature = "signature";
inline constexpr const char* kEnvelopeKeyBag = "bag";

// True when the signature is RSA PKCS#1 v1.5 over the SHA-1 digest of the bag bytes.
bool verifyStorebagSignature(const crypto::PublicKey& key, const Bytes& bag, const Bytes& signature);

enum class EnvelopeStatus {
  Verified,              // signature good and bag decoded
  NotPropertyList,       // the envelope does not decode (detail: the reason)
  SignatureMissing,      // no "signature" (also: the envelope is not a dictionary)
  NoPublicKey,           // the public key cannot be read or made
  BadSignatureEncoding,  // "signature" is not base64 text
  BadBagEncoding,        // "bag" is missing or not base64 text
  SignatureInvalid,      // the signature does not verify
  BagNotPropertyList,    // signature good, but the bag does not decode
};

// A short text for people, e.g. "signature can not be verified".
std::string envelopeStatusText(EnvelopeStatus status);

// Where the public key comes from: DER bytes, or nothing when there is no key.
using PublicKeyLoader = std::function<std::optional<Bytes>()>;
// Reads the key file at `path` on every call.
PublicKeyLoader publicKeyFileLoader(std::string path);

struct EnvelopeCheck {
  EnvelopeStatus status = EnvelopeStatus::NotPropertyList;
  std::string detail;              // the decoder's reason, when there is one
  std::optional<Bytes> bag;        // the decoded bag bytes once the signature verified
  std::optional<Value> document;   // the decoded bag (before the shared values)
  const void* keyIdentity = nullptr;  // identifies the key object in log lines
};

// The envelope checks in order, stopping at the first failure.
EnvelopeCheck checkStorebagEnvelope(const Bytes& envelope, const PublicKeyLoader& loadPublicKey);

class StorebagVerifier {
 public:
  // `cache` receives good envelopes when a check asks for saving; it may be null when
  // no check will.
  StorebagVerifier(PublicKeyLoader loadPublicKey, const StorebagDiskCache* cache);

  // The verification step: the macro-expanded document of a good envelope, or nothing.
  // With `save`, a good envelope is written to the disk cache as it was passed in.
  std::optional<Value> verify(const std::string& name, const Bytes& envelope, bool save) const;

 private:
  PublicKeyLoader loadPublicKey_;
  const StorebagDiskCache* cache_;
};

}  // namespace telvane
