#include "storebag/StorebagSigner.h"

#include <openssl/bio.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <utility>

#include "platform/Crypto.h"
#include "platform/PropertyList.h"
#include "storebag/StorebagEnvelope.h"

namespace telvane {

namespace {

void freeKey(void* key) { EVP_PKEY_free(static_cast<EVP_PKEY*>(key)); }

}  // namespace

Result<StorebagKeyPair> generateStorebagKeyPair(int bits) {
  EVP_PKEY* key = EVP_RSA_gen(static_cast<unsigned>(bits));
  if (!key) return Result<StorebagKeyPair>::failure("RSA key generation failed");
  std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)> owned(key, EVP_PKEY_free);

  StorebagKeyPair pair;
  std::unique_ptr<BIO, decltype(&BIO_free)> bio(BIO_new(BIO_s_mem()), BIO_free);
  if (!bio || PEM_write_bio_PrivateKey(bio.get(), key, nullptr, nullptr, 0, nullptr, nullptr) != 1) {
    return Result<StorebagKeyPair>::failure("could not write the private key");
  }
  char* pem = nullptr;
  long pemSize = BIO_get_mem_data(bio.get(), &pem);
  pair.privateKeyPem.assign(pem, static_cast<std::size_t>(pemSize));

  int derSize = i2d_PUBKEY(key, nullptr);
  if (derSize <= 0) return Result<StorebagKeyPair>::failure("could not write the public key");
  pair.publicKeyDer.resize(static_cast<std::size_t>(derSize));
  unsigned char* out = pair.publicKeyDer.data();
  i2d_PUBKEY(key, &out);
  return Result<StorebagKeyPair>::success(std::move(pair));
}

Result<StorebagSigner> StorebagSigner::fromPrivateKeyPem(const std::string& pem) {
  std::unique_ptr<BIO, decltype(&BIO_free)> bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())), BIO_free);
  EVP_PKEY* key = bio ? PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, nullptr) : nullptr;
  if (!key) return Result<StorebagSigner>::failure("not a PEM private key");
  if (EVP_PKEY_get_base_id(key) != EVP_PKEY_RSA) {
    EVP_PKEY_free(key);
    return Result<StorebagSigner>::failure("not an RSA private key");
  }
  return Result<StorebagSigner>::success(StorebagSigner(std::shared_ptr<void>(key, freeKey)));
}

Result<Bytes> StorebagSigner::sign(const Bytes& data) const {
  std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> context(EVP_MD_CTX_new(), EVP_MD_CTX_free);
  EVP_PKEY_CTX* keyContext = nullptr;
  if (!context ||
      EVP_DigestSignInit(context.get(), &keyContext, EVP_sha1(), nullptr, static_cast<EVP_PKEY*>(key_.get())) != 1 ||
      EVP_PKEY_CTX_set_rsa_padding(keyContext, RSA_PKCS1_PADDING) != 1) {
    return Result<Bytes>::failure("could not start signing");
  }
  std::size_t size = 0;
  if (EVP_DigestSign(context.get(), nullptr, &size, data.data(), data.size()) != 1) {
    return Result<Bytes>::failure("could not size the signature");
  }
  Bytes signature(size);
  if (EVP_DigestSign(context.get(), signature.data(), &size, data.data(), data.size()) != 1) {
    return Result<Bytes>::failure("signing failed");
  }
  signature.resize(size);
  return Result<Bytes>::success(std::move(signature));
}

Result<Bytes> StorebagSigner::makeEnvelope(const Bytes& bag) const {
  Result<Bytes> signature = sign(bag);
  if (!signature) return Result<Bytes>::failure(signature.error());
  return makeStorebagEnvelope(crypto::base64Encode(*signature), crypto::base64Encode(bag));
}

Result<Bytes> StorebagSigner::makeEnvelopeForDocument(const Value& document) const {
  Result<Bytes> bag = plist::encodeBinary(document);
  if (!bag) return Result<Bytes>::failure("document is not a property list: " + bag.error());
  return makeEnvelope(*bag);
}

Result<Bytes> makeStorebagEnvelope(const std::string& signatureBase64, const std::string& bagBase64) {
  return plist::encodeBinary(Value(Dictionary{{kEnvelopeKeySignature, Value(signatureBase64)},
                                              {kEnvelopeKeyBag, Value(bagBase64)}}));
}

}  // namespace telvane
