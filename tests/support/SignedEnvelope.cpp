#include "support/SignedEnvelope.h"

#include <fstream>
#include <stdexcept>
#include <utility>

#include "platform/Crypto.h"
#include "platform/PropertyList.h"

namespace telvane::test {

namespace {

StorebagKeyPair freshKeys() {
  Result<StorebagKeyPair> pair = generateStorebagKeyPair();
  if (!pair) throw std::runtime_error("test key generation failed: " + pair.error());
  return std::move(pair).value();
}

StorebagSigner signerFor(const StorebagKeyPair& keys) {
  Result<StorebagSigner> signer = StorebagSigner::fromPrivateKeyPem(keys.privateKeyPem);
  if (!signer) throw std::runtime_error("test signer failed: " + signer.error());
  return std::move(signer).value();
}

Dictionary decodeEnvelope(const Bytes& envelope) {
  Result<Value> decoded = plist::decode(envelope);
  if (!decoded || !decoded->isDictionary()) throw std::runtime_error("not an envelope");
  return *decoded->asDictionary();
}

Bytes encode(const Dictionary& fields) {
  Result<Bytes> bytes = plist::encodeBinary(Value(fields));
  if (!bytes) throw std::runtime_error("envelope encoding failed: " + bytes.error());
  return std::move(bytes).value();
}

void writeBytes(const std::filesystem::path& path, const void* data, std::size_t size) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(static_cast<const char*>(data), static_cast<std::streamsize>(size));
  if (!out) throw std::runtime_error("could not write " + path.string());
}

}  // namespace

TestKeyPair::TestKeyPair() : keys_(freshKeys()), signer_(signerFor(keys_)) {}

const TestKeyPair& TestKeyPair::shared() {
  static const TestKeyPair keys;
  return keys;
}

PublicKeyLoader TestKeyPair::publicKeyLoader() const {
  Bytes der = keys_.publicKeyDer;
  return [der]() -> std::optional<Bytes> { return der; };
}

void TestKeyPair::writePrivateKey(const std::filesystem::path& path) const {
  writeBytes(path, keys_.privateKeyPem.data(), keys_.privateKeyPem.size());
}

void TestKeyPair::writePublicKey(const std::filesystem::path& path) const {
  writeBytes(path, keys_.publicKeyDer.data(), keys_.publicKeyDer.size());
}

Bytes SignedEnvelopeBuilder::sign(const Value& document) const {
  Result<Bytes> envelope = keys_.signer().makeEnvelopeForDocument(document);
  if (!envelope) throw std::runtime_error("signing failed: " + envelope.error());
  return std::move(envelope).value();
}

Bytes SignedEnvelopeBuilder::signBag(const Bytes& bag) const {
  Result<Bytes> envelope = keys_.signer().makeEnvelope(bag);
  if (!envelope) throw std::runtime_error("signing failed: " + envelope.error());
  return std::move(envelope).value();
}

Bytes SignedEnvelopeBuilder::signAsXml(const Value& document) const {
  Result<Value> fields = plist::decode(sign(document));
  Result<std::string> xml = plist::encodeXml(*fields);
  if (!xml) throw std::runtime_error("xml encoding failed: " + xml.error());
  return bytesOf(*xml);
}

namespace tamper {

Bytes changeBagByte(const Bytes& envelope, std::size_t index) {
  Dictionary fields = decodeEnvelope(envelope);
  Result<Bytes> bag = crypto::base64Decode(fields.get(kEnvelopeKeyBag).stringOrEmpty());
  if (!bag || index >= bag->size()) throw std::runtime_error("no such bag byte");
  Bytes changed = *bag;
  changed[index] ^= 0x01;
  fields.set(kEnvelopeKeyBag, Value(crypto::base64Encode(changed)));
  return encode(fields);
}

Bytes removeKey(const Bytes& envelope, const std::string& key) {
  Dictionary fields = decodeEnvelope(envelope);
  fields.erase(key);
  return encode(fields);
}

Bytes setKey(const Bytes& envelope, const std::string& key, const Value& value) {
  Dictionary fields = decodeEnvelope(envelope);
  fields.set(key, value);
  return encode(fields);
}

}  // namespace tamper

Bytes bytesOf(const std::string& text) { return Bytes(text.begin(), text.end()); }

}  // namespace telvane::test
