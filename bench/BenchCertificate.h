// BenchCertificate: a self-signed TLS server certificate for the load benchmarks'
// loopback HTTPS server, made with OpenSSL when the benchmark starts.
//
// The certificate names 127.0.0.1 and localhost (subject alternative names) and is
// its own trust anchor: a client that trusts the certificate file itself (for the
// daemon: $TELVANED_CA_FILE) accepts the server. The key is EC P-256, quick to make.
//
// Threading: a plain function; safe from any thread.
#pragma once

#include <string>

namespace telvane::bench {

// Writes the certificate and its private key as PEM files. False (and the reason in
// `error`) when OpenSSL or the file system fails.
bool writeSelfSignedCertificate(const std::string& certificatePath, const std::string& keyPath,
                                std::string* error);

}  // namespace telvane::bench
