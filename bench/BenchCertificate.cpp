#include "BenchCertificate.h"

#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>

#include <cstdio>
#include <memory>

namespace telvane::bench {

namespace {

struct KeyFree {
  void operator()(EVP_PKEY* key) const { EVP_PKEY_free(key); }
};
struct CertificateFree {
  void operator()(X509* certificate) const { X509_free(certificate); }
};
struct FileClose {
  void operator()(FILE* file) const { std::fclose(file); }
};

bool addExtension(X509* certificate, int nid, const char* value) {
  X509V3_CTX context;
  X509V3_set_ctx_nodb(&context);
  X509V3_set_ctx(&context, certificate, certificate, nullptr, nullptr, 0);
  X509_EXTENSION* extension = X509V3_EXT_conf_nid(nullptr, &context, nid, value);
  if (!extension) return false;
  const bool added = X509_add_ext(certificate, extension, -1) == 1;
  X509_EXTENSION_free(extension);
  return added;
}

}  // namespace

bool writeSelfSignedCertificate(const std::string& certificatePath, const std::string& keyPath,
                                std::string* error) {
  auto fail = [error](const char* what) {
    if (error) *error = what;
    return false;
  };
  std::unique_ptr<EVP_PKEY, KeyFree> key(EVP_EC_gen("P-256"));
  if (!key) return fail("EVP_EC_gen failed");
  std::unique_ptr<X509, CertificateFree> certificate(X509_new());
  if (!certificate) return fail("X509_new failed");
  X509* c = certificate.get();
  X509_set_version(c, 2);
  ASN1_INTEGER_set(X509_get_serialNumber(c), 1);
  X509_gmtime_adj(X509_getm_notBefore(c), -3600);
  X509_gmtime_adj(X509_getm_notAfter(c), 7L * 24 * 3600);
  X509_set_pubkey(c, key.get());
  X509_NAME* name = X509_get_subject_name(c);
  X509_NAME_add_entry_by_txt(name, "O", MBSTRING_ASC, reinterpret_cast<const unsigned char*>("telvane bench"), -1, -1,
                             0);
  X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC, reinterpret_cast<const unsigned char*>("localhost"), -1, -1, 0);
  X509_set_issuer_name(c, name);
  if (!addExtension(c, NID_basic_constraints, "critical,CA:FALSE") ||
      !addExtension(c, NID_key_usage, "critical,digitalSignature") ||
      !addExtension(c, NID_ext_key_usage, "serverAuth") ||
      !addExtension(c, NID_subject_key_identifier, "hash") ||
      !addExtension(c, NID_subject_alt_name, "IP:127.0.0.1,DNS:localhost")) {
    return fail("X509V3_EXT_conf_nid failed");
  }
  if (X509_sign(c, key.get(), EVP_sha256()) <= 0) return fail("X509_sign failed");

  std::unique_ptr<FILE, FileClose> certificateFile(std::fopen(certificatePath.c_str(), "w"));
  if (!certificateFile || PEM_write_X509(certificateFile.get(), c) != 1) {
    return fail("cannot write the certificate file");
  }
  std::unique_ptr<FILE, FileClose> keyFile(std::fopen(keyPath.c_str(), "w"));
  if (!keyFile || PEM_write_PrivateKey(keyFile.get(), key.get(), nullptr, nullptr, 0, nullptr, nullptr) != 1) {
    return fail("cannot write the key file");
  }
  return true;
}

}  // namespace telvane::bench
