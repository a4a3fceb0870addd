// Test keys and signed storebag envelopes.
//
// TestKeyPair makes a fresh RSA key pair at run time (`shared()` makes one per test
// process and keeps it); SignedEnvelopeBuilder signs documents or raw bag bytes into
// the envelopes the daemon verifies; the tampering helpers damage an envelope in one
// chosen way. The storebag server of the tests serves what these build.
//
// Threading: `shared()` is safe from any thread; the rest is immutable after
// construction.
#pragma once

#include <cstddef>
#include <filesystem>
#include <string>

#include "storebag/StorebagEnvelope.h"
#include "storebag/StorebagSigner.h"
#include "telvane/Value.h"

namespace telvane::test {

class TestKeyPair {
 public:
  // A new key pair (about a tenth of a second for 2048 bits).
  TestKeyPair();
  static const TestKeyPair& shared();

  const std::string& privateKeyPem() const { return keys_.privateKeyPem; }
  const Bytes& publicKeyDer() const { return keys_.publicKeyDer; }
  const StorebagSigner& signer() const { return signer_; }
  // A loader that hands out this public key.
  PublicKeyLoader publicKeyLoader() const;
  void writePrivateKey(const std::filesystem::path& path) const;
  void writePublicKey(const std::filesystem::path& path) const;

 private:
  StorebagKeyPair keys_;
  StorebagSigner signer_;
};

class SignedEnvelopeBuilder {
 public:
  explicit SignedEnvelopeBuilder(const TestKeyPair& keys = TestKeyPair::shared()) : keys_(keys) {}

  // The document as a binary property list, signed.
  Bytes sign(const Value& document) const;
  // Raw bag bytes (any content), signed.
  Bytes signBag(const Bytes& bag) const;
  // The envelope as an XML property list instead of a binary one.
  Bytes signAsXml(const Value& document) const;

 private:
  const TestKeyPair& keys_;
};

// Tampering: each returns a damaged copy of a good envelope.
namespace tamper {
// The bag with one byte of its decoded bytes changed (signature kept).
Bytes changeBagByte(const Bytes& envelope, std::size_t index);
// The envelope without one of its keys.
Bytes removeKey(const Bytes& envelope, const std::string& key);
// The envelope with one key set to a value (e.g. bad base64 text or a number).
Bytes setKey(const Bytes& envelope, const std::string& key, const Value& value);
}  // namespace tamper

Bytes bytesOf(const std::string& text);

}  // namespace telvane::test
