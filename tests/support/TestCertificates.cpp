#include "support/TestCertificates.h"

#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>

namespace telvane::test {
namespace {

void check(bool ok, const char* what) {
  if (!ok) {
    std::fprintf(stderr, "TestCertificates: %s failed\n", what);
    std::abort();
  }
}

EVP_PKEY* makeKey() {
  EVP_PKEY* key = EVP_EC_gen("P-256");
  check(key != nullptr, "EVP_EC_gen");
  return key;
}

void addExtension(X509* certificate, X509* issuer, int nid, const char* value) {
  X509V3_CTX context;
  X509V3_set_ctx_nodb(&context);
  X509V3_set_ctx(&context, issuer, certificate, nullptr, nullptr, 0);
  X509_EXTENSION* extension = X509V3_EXT_conf_nid(nullptr, &context, nid, value);
  check(extension != nullptr, "X509V3_EXT_conf_nid");
  X509_add_ext(certificate, extension, -1);
  X509_EXTENSION_free(extension);
}

// A certificate for `key` named `commonName`, signed by issuerKey (self-signed when
// issuer is null).
X509* makeCertificate(EVP_PKEY* key, const char* commonName, X509* issuer, EVP_PKEY* issuerKey, long serial,
                      bool isCA) {
  X509* certificate = X509_new();
  X509_set_version(certificate, 2);
  ASN1_INTEGER_set(X509_get_serialNumber(certificate), serial);
  X509_gmtime_adj(X509_getm_notBefore(certificate), -3600);
  X509_gmtime_adj(X509_getm_notAfter(certificate), 7L * 24 * 3600);
  X509_set_pubkey(certificate, key);
  X509_NAME* name = X509_get_subject_name(certificate);
  X509_NAME_add_entry_by_txt(name, "O", MBSTRING_ASC, reinterpret_cast<const unsigned char*>("telvane tests"), -1,
                             -1, 0);
  X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC, reinterpret_cast<const unsigned char*>(commonName), -1, -1,
                             0);
  X509_set_issuer_name(certificate, issuer ? X509_get_subject_name(issuer) : name);
  X509* issuerForExtensions = issuer ? issuer : certificate;
  if (isCA) {
    addExtension(certificate, issuerForExtensions, NID_basic_constraints, "critical,CA:TRUE");
    addExtension(certificate, issuerForExtensions, NID_key_usage, "critical,keyCertSign,cRLSign");
    addExtension(certificate, issuerForExtensions, NID_subject_key_identifier, "hash");
  } else {
    addExtension(certificate, issuerForExtensions, NID_basic_constraints, "critical,CA:FALSE");
    addExtension(certificate, issuerForExtensions, NID_key_usage, "critical,digitalSignature,keyEncipherment");
    addExtension(certificate, issuerForExtensions, NID_ext_key_usage, "serverAuth");
    addExtension(certificate, issuerForExtensions, NID_subject_alt_name, "IP:127.0.0.1,DNS:localhost");
    addExtension(certificate, issuerForExtensions, NID_authority_key_identifier, "keyid");
  }
  check(X509_sign(certificate, issuerKey, EVP_sha256()) > 0, "X509_sign");
  return certificate;
}

void writeCertificate(const std::filesystem::path& path, X509* certificate) {
  FILE* file = std::fopen(path.c_str(), "w");
  check(file != nullptr, "fopen");
  check(PEM_write_X509(file, certificate) == 1, "PEM_write_X509");
  std::fclose(file);
}

void writeKey(const std::filesystem::path& path, EVP_PKEY* key) {
  FILE* file = std::fopen(path.c_str(), "w");
  check(file != nullptr, "fopen");
  check(PEM_write_PrivateKey(file, key, nullptr, nullptr, 0, nullptr, nullptr) == 1, "PEM_write_PrivateKey");
  std::fclose(file);
}

}  // namespace

const TestCertificates& TestCertificates::shared() {
  // Kept for the life of the process; the folder is removed at exit.
  static const TestCertificates* certificates = new TestCertificates();
  return *certificates;
}

TestCertificates::TestCertificates() {
  std::string pattern = (std::filesystem::temp_directory_path() / "telvane-certs-XXXXXX").string();
  check(::mkdtemp(pattern.data()) != nullptr, "mkdtemp");
  folder_ = pattern;
  static std::filesystem::path folderToRemove;
  folderToRemove = folder_;
  std::atexit([] {
    std::error_code ignored;
    std::filesystem::remove_all(folderToRemove, ignored);
  });

  EVP_PKEY* caKey = makeKey();
  X509* ca = makeCertificate(caKey, "telvane test CA", nullptr, caKey, 1, true);
  EVP_PKEY* serverKey = makeKey();
  X509* server = makeCertificate(serverKey, "localhost", ca, caKey, 2, false);
  EVP_PKEY* otherKey = makeKey();
  X509* other = makeCertificate(otherKey, "telvane other CA", nullptr, otherKey, 3, true);

  writeCertificate(folder_ / "ca.pem", ca);
  writeCertificate(folder_ / "server-cert.pem", server);
  writeKey(folder_ / "server-key.pem", serverKey);
  writeCertificate(folder_ / "other-ca.pem", other);

  X509_free(other);
  EVP_PKEY_free(otherKey);
  X509_free(server);
  EVP_PKEY_free(serverKey);
  X509_free(ca);
  EVP_PKEY_free(caKey);
}

}  // namespace telvane::test
