// DevServerState: the development server's state folder. On first use it makes the
// storebag signing key pair (RSA-2048, the same keys `telvane-storebag keygen` makes)
// and a self-signed TLS certificate for 127.0.0.1 and localhost; later runs load
// them, so that a daemon that trusts them once keeps trusting them. A certificate
// that has expired (or is about to) is made anew with the same file names.
//
// Files: storebag-private.pem (PKCS#8), publicKey.der (SubjectPublicKeyInfo, what
// the daemon reads through TELVANED_PUBLIC_KEY), tls-cert.pem (also the CA file the
// daemon trusts through TELVANED_CA_FILE), tls-key.pem, and the folder uploads/.
//
// Threading: prepare() runs once at start-up; afterwards the object is immutable and
// may be read from any thread.
#pragma once

#include <optional>
#include <string>

#include "platform/Result.h"
#include "storebag/StorebagSigner.h"

namespace telvane::devserver {

class DevServerState {
 public:
  // Creates the folder and whatever is missing in it. The text says what failed.
  static Result<DevServerState> prepare(const std::string& folder);

  const std::string& folder() const { return folder_; }
  std::string privateKeyPath() const { return folder_ + "/storebag-private.pem"; }
  std::string publicKeyPath() const { return folder_ + "/publicKey.der"; }
  std::string certificatePath() const { return folder_ + "/tls-cert.pem"; }
  std::string certificateKeyPath() const { return folder_ + "/tls-key.pem"; }
  std::string uploadsDir() const { return folder_ + "/uploads"; }

  const StorebagSigner& signer() const { return *signer_; }
  // What prepare() made on this run (for the start-up lines).
  bool madeSigningKey() const { return madeSigningKey_; }
  bool madeCertificate() const { return madeCertificate_; }

 private:
  explicit DevServerState(std::string folder) : folder_(std::move(folder)) {}

  std::string folder_;
  std::optional<StorebagSigner> signer_;
  bool madeSigningKey_ = false;
  bool madeCertificate_ = false;
};

// Writes a self-signed certificate (EC P-256, valid for `days` days, subject
// alternative names IP:127.0.0.1 and DNS:localhost, usable as its own trust anchor)
// and its private key as PEM files.
Status writeSelfSignedCertificate(const std::string& certificatePath, const std::string& keyPath, int days);

// True when the PEM certificate at the path exists and is valid for at least `hours`
// more hours.
bool certificateValidFor(const std::string& certificatePath, int hours);

}  // namespace telvane::devserver
