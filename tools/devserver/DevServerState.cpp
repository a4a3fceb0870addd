#include "devserver/DevServerState.h"

#include <openssl/bn.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rand.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>
#include <sys/stat.h>

#include <cstdio>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <system_error>

namespace telvane::devserver {

namespace {

// A year and a month; the certificate is made anew once it runs out.
constexpr int kCertificateDays = 400;
// A certificate closer to its end than this is replaced at start-up.
constexpr int kCertificateRenewHours = 24;

using KeyPtr = std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)>;
using CertificatePtr = std::unique_ptr<X509, decltype(&X509_free)>;

bool exists(const std::string& path) {
  std::error_code error;
  return std::filesystem::exists(path, error);
}

std::optional<std::string> readText(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::nullopt;
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  if (in.bad()) return std::nullopt;
  return text;
}

// Writes through a temporary file and a rename, so that a reader never sees half a
// key; `mode` is applied before any byte is written.
bool writeFileAtomically(const std::string& path, const void* data, std::size_t size, mode_t mode) {
  std::string temporary = path + ".tmp";
  std::FILE* file = std::fopen(temporary.c_str(), "wb");
  if (!file) return false;
  ::chmod(temporary.c_str(), mode);
  bool ok = std::fwrite(data, 1, size, file) == size;
  ok = std::fclose(file) == 0 && ok;
  if (!ok || std::rename(temporary.c_str(), path.c_str()) != 0) {
    std::remove(temporary.c_str());
    return false;
  }
  return true;
}

bool addExtension(X509* certificate, int nid, const char* value) {
  X509V3_CTX context;
  X509V3_set_ctx_nodb(&context);
  X509V3_set_ctx(&context, certificate, certificate, nullptr, nullptr, 0);
  X509_EXTENSION* extension = X509V3_EXT_conf_nid(nullptr, &context, nid, value);
  if (!extension) return false;
  bool added = X509_add_ext(certificate, extension, -1) == 1;
  X509_EXTENSION_free(extension);
  return added;
}

std::string pemOf(int (*write)(BIO*, void*), void* object) {
  std::unique_ptr<BIO, decltype(&BIO_free)> bio(BIO_new(BIO_s_mem()), BIO_free);
  if (!bio || write(bio.get(), object) != 1) return {};
  char* data = nullptr;
  long size = BIO_get_mem_data(bio.get(), &data);
  return std::string(data, static_cast<std::size_t>(size));
}

int writeCertificatePem(BIO* bio, void* certificate) {
  return PEM_write_bio_X509(bio, static_cast<X509*>(certificate));
}
int writePrivateKeyPem(BIO* bio, void* key) {
  return PEM_write_bio_PrivateKey(bio, static_cast<EVP_PKEY*>(key), nullptr, nullptr, 0, nullptr, nullptr);
}

}  // namespace

Status writeSelfSignedCertificate(const std::string& certificatePath, const std::string& keyPath, int days) {
  KeyPtr key(EVP_EC_gen("P-256"), EVP_PKEY_free);
  if (!key) return statusError("could not make a TLS key");
  CertificatePtr certificate(X509_new(), X509_free);
  if (!certificate) return statusError("could not make a certificate");
  X509* cert = certificate.get();
  X509_set_version(cert, 2);
  // A random serial, so that a renewed certificate never repeats an old one.
  unsigned char serialBytes[16];
  if (RAND_bytes(serialBytes, sizeof serialBytes) != 1) return statusError("no random serial number");
  serialBytes[0] &= 0x7F;
  std::unique_ptr<BIGNUM, decltype(&BN_free)> serial(BN_bin2bn(serialBytes, sizeof serialBytes, nullptr), BN_free);
  if (!serial || !BN_to_ASN1_INTEGER(serial.get(), X509_get_serialNumber(cert))) {
    return statusError("could not set the serial number");
  }
  // Valid from an hour ago, so that a clock a little behind still accepts it.
  X509_gmtime_adj(X509_getm_notBefore(cert), -3600);
  X509_gmtime_adj(X509_getm_notAfter(cert), static_cast<long>(days) * 24 * 3600);
  X509_set_pubkey(cert, key.get());
  X509_NAME* name = X509_get_subject_name(cert);
  X509_NAME_add_entry_by_txt(name, "O", MBSTRING_ASC, reinterpret_cast<const unsigned char*>("telvane development"),
                             -1, -1, 0);
  X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC, reinterpret_cast<const unsigned char*>("telvane-devserver"),
                             -1, -1, 0);
  X509_set_issuer_name(cert, name);
  // The certificate is its own trust anchor: a CA that may only sign itself.
  bool extended = addExtension(cert, NID_basic_constraints, "critical,CA:TRUE,pathlen:0") &&
                  addExtension(cert, NID_key_usage, "critical,digitalSignature,keyCertSign") &&
                  addExtension(cert, NID_ext_key_usage, "serverAuth") &&
                  addExtension(cert, NID_subject_key_identifier, "hash") &&
                  addExtension(cert, NID_subject_alt_name, "IP:127.0.0.1,DNS:localhost");
  if (!extended) {
    ERR_clear_error();
    return statusError("could not add the certificate's extensions");
  }
  if (X509_sign(cert, key.get(), EVP_sha256()) <= 0) return statusError("could not sign the certificate");

  std::string keyPem = pemOf(writePrivateKeyPem, key.get());
  std::string certificatePem = pemOf(writeCertificatePem, cert);
  if (keyPem.empty() || certificatePem.empty()) return statusError("could not write the certificate as PEM");
  if (!writeFileAtomically(keyPath, keyPem.data(), keyPem.size(), 0600)) {
    return statusError("could not write " + keyPath);
  }
  if (!writeFileAtomically(certificatePath, certificatePem.data(), certificatePem.size(), 0644)) {
    return statusError("could not write " + certificatePath);
  }
  return statusOk();
}

bool certificateValidFor(const std::string& certificatePath, int hours) {
  std::FILE* file = std::fopen(certificatePath.c_str(), "r");
  if (!file) return false;
  X509* certificate = PEM_read_X509(file, nullptr, nullptr, nullptr);
  std::fclose(file);
  ERR_clear_error();
  if (!certificate) return false;
  std::time_t until = std::time(nullptr) + static_cast<std::time_t>(hours) * 3600;
  bool valid = X509_cmp_time(X509_get0_notAfter(certificate), &until) > 0 &&
               X509_cmp_current_time(X509_get0_notBefore(certificate)) < 0;
  X509_free(certificate);
  return valid;
}

Result<DevServerState> DevServerState::prepare(const std::string& folder) {
  using R = Result<DevServerState>;
  std::error_code error;
  std::filesystem::create_directories(folder, error);
  if (error) return R::failure("could not create the state folder " + folder + ": " + error.message());
  DevServerState state(std::filesystem::absolute(folder, error).lexically_normal().string());
  if (error) state.folder_ = folder;
  std::filesystem::create_directories(state.uploadsDir(), error);
  if (error) return R::failure("could not create " + state.uploadsDir() + ": " + error.message());

  // The signing key pair: both files, or make both anew.
  if (!exists(state.privateKeyPath()) || !exists(state.publicKeyPath())) {
    Result<StorebagKeyPair> pair = generateStorebagKeyPair(kStorebagKeyBits);
    if (!pair) return R::failure(pair.error());
    if (!writeFileAtomically(state.privateKeyPath(), pair->privateKeyPem.data(), pair->privateKeyPem.size(), 0600) ||
        !writeFileAtomically(state.publicKeyPath(), pair->publicKeyDer.data(), pair->publicKeyDer.size(), 0644)) {
      return R::failure("could not write the storebag key pair into " + state.folder_);
    }
    state.madeSigningKey_ = true;
  }
  std::optional<std::string> pem = readText(state.privateKeyPath());
  if (!pem) return R::failure("could not read " + state.privateKeyPath());
  Result<StorebagSigner> signer = StorebagSigner::fromPrivateKeyPem(*pem);
  if (!signer) return R::failure(state.privateKeyPath() + ": " + signer.error());
  state.signer_ = signer.value();

  if (!exists(state.certificateKeyPath()) || !certificateValidFor(state.certificatePath(), kCertificateRenewHours)) {
    Status made = writeSelfSignedCertificate(state.certificatePath(), state.certificateKeyPath(), kCertificateDays);
    if (!made) return R::failure(made.error());
    state.madeCertificate_ = true;
  }
  return R::success(std::move(state));
}

}  // namespace telvane::devserver
