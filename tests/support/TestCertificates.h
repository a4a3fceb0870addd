// TestCertificates: a test certificate authority and a server certificate it signed,
// made with OpenSSL when first asked for and written as PEM files to a temporary
// folder that lives as long as the test process.
//
// The server certificate names 127.0.0.1 and localhost (subject alternative names),
// so a client that trusts caFile() accepts a loopback TLS server using serverCertFile()
// and serverKeyFile(). Keys are EC P-256 (quick to make). A second, unrelated CA
// (otherCaFile()) lets tests show that trust really depends on the CA file.
//
// Threading: shared() is thread-safe; the object is immutable afterwards.
#pragma once

#include <filesystem>
#include <memory>
#include <string>

namespace telvane::test {

class TestCertificates {
 public:
  // The process's certificates, made on first use. Aborts the test binary when
  // OpenSSL fails (nothing could be tested then).
  static const TestCertificates& shared();

  std::string caFile() const { return (folder_ / "ca.pem").string(); }
  std::string serverCertFile() const { return (folder_ / "server-cert.pem").string(); }
  std::string serverKeyFile() const { return (folder_ / "server-key.pem").string(); }
  std::string otherCaFile() const { return (folder_ / "other-ca.pem").string(); }
  const std::filesystem::path& folder() const { return folder_; }

 private:
  TestCertificates();
  std::filesystem::path folder_;
};

}  // namespace telvane::test
