#include "storebag/StorebagEnvelope.h"

#include <fstream>
#include <iterator>
#include <utility>

#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "storebag/StorebagMacros.h"

namespace telvane {

bool verifyStorebagSignature(const crypto::PublicKey& key, const Bytes& bag, const Bytes& signature) {
  return key.verifySha1(bag.data(), bag.size(), signature).ok();
}

std::string envelopeStatusText(EnvelopeStatus status) {
  switch (status) {
    case EnvelopeStatus::Verified:
      return "OK";
    case EnvelopeStatus::NotPropertyList:
      return "envelope is not a property list";
    case EnvelopeStatus::SignatureMissing:
      return "signature is missing";
    case EnvelopeStatus::NoPublicKey:
      return "public key can not be read";
    case EnvelopeStatus::BadSignatureEncoding:
      return "signature is not base64";
    case EnvelopeStatus::BadBagEncoding:
      return "bag is missing or not base64";
    case EnvelopeStatus::SignatureInvalid:
      return "signature can not be verified";
    case EnvelopeStatus::BagNotPropertyList:
      return "bag is not a property list";
  }
  return "unknown";
}

PublicKeyLoader publicKeyFileLoader(std::string path) {
  return [path = std::move(path)]() -> std::optional<Bytes> {
    std::ifstream in(path, std::ios::binary);
    if (!in) return std::nullopt;
    Bytes der((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    if (in.bad()) return std::nullopt;
    return der;
  };
}

EnvelopeCheck checkStorebagEnvelope(const Bytes& envelope, const PublicKeyLoader& loadPublicKey) {
  EnvelopeCheck check;
  Result<Value> decoded = plist::decode(envelope);
  if (!decoded) {
    check.status = EnvelopeStatus::NotPropertyList;
    check.detail = decoded.error();
    return check;
  }
  const Dictionary* fields = decoded->asDictionary();
  const Value* signatureText = fields ? fields->find(kEnvelopeKeySignature) : nullptr;
  if (!signatureText) {
    check.status = EnvelopeStatus::SignatureMissing;
    return check;
  }

  std::optional<Bytes> der = loadPublicKey ? loadPublicKey() : std::nullopt;
  Result<crypto::PublicKey> key = der ? crypto::PublicKey::fromDer(*der)
                                      : Result<crypto::PublicKey>::failure("no public key");
  if (!key) {
    check.status = EnvelopeStatus::NoPublicKey;
    check.detail = key.error();
    return check;
  }
  check.keyIdentity = &*key;

  Result<Bytes> signature = signatureText->isString() ? crypto::base64Decode(*signatureText->asString())
                                                      : Result<Bytes>::failure("signature is not text");
  if (!signature) {
    check.status = EnvelopeStatus::BadSignatureEncoding;
    check.detail = signature.error();
    return check;
  }
  const Value* bagText = fields->find(kEnvelopeKeyBag);
  Result<Bytes> bag = bagText && bagText->isString() ? crypto::base64Decode(*bagText->asString())
                                                     : Result<Bytes>::failure("bag is missing or not text");
  if (!bag) {
    check.status = EnvelopeStatus::BadBagEncoding;
    check.detail = bag.error();
    return check;
  }
  if (!verifyStorebagSignature(*key, *bag, *signature)) {
    check.status = EnvelopeStatus::SignatureInvalid;
    return check;
  }
  check.bag = std::move(bag).value();
  Result<Value> document = plist::decode(*check.bag);
  if (!document) {
    check.status = EnvelopeStatus::BagNotPropertyList;
    check.detail = document.error();
    return check;
  }
  check.status = EnvelopeStatus::Verified;
  check.document = std::move(document).value();
  return check;
}

StorebagVerifier::StorebagVerifier(PublicKeyLoader loadPublicKey, const StorebagDiskCache* cache)
    : loadPublicKey_(std::move(loadPublicKey)), cache_(cache) {}

std::optional<Value> StorebagVerifier::verify(const std::string& name, const Bytes& envelope, bool save) const {
  EnvelopeCheck check = checkStorebagEnvelope(envelope, loadPublicKey_);
  switch (check.status) {
    case EnvelopeStatus::NotPropertyList:
      // Reading the signature from nothing finds none.
      log::error("fetchStorebagWithName: propertyListWithData error %s", check.detail);
      log::error("fetchStorebagWithName: Signature is missing");
      return std::nullopt;
    case EnvelopeStatus::SignatureMissing:
      log::error("fetchStorebagWithName: Signature is missing");
      return std::nullopt;
    case EnvelopeStatus::NoPublicKey:
    case EnvelopeStatus::BadSignatureEncoding:
    case EnvelopeStatus::BadBagEncoding:
      return std::nullopt;
    case EnvelopeStatus::SignatureInvalid:
      log::error("fetchStorebagWithName: Signature can not be verified, %p", check.keyIdentity);
      return std::nullopt;
    case EnvelopeStatus::Verified:
    case EnvelopeStatus::BagNotPropertyList:
      break;
  }
  // The signature is good: the envelope is kept even when its bag turns out not to
  // be a document.
  if (save && cache_ && cache_->save(name, envelope)) {
    log::info("fetchStorebagWithName: storebag '%s' has been saved to disk cache", name);
  }
  if (!check.document) return std::nullopt;
  return applySharedValues(*check.document);
}

}  // namespace telvane
