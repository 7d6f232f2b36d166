// A local TLS identity for servers on this machine (coverage-sim, test servers): a
// self-signed CA and a server certificate for localhost and 127.0.0.1 issued by it, kept as
// PEM files in a directory and reused across runs. Clients trust the CA through the platform
// root's tls.plist. Stateless; call from one thread per directory.
#pragma once

#include <string>

namespace qax {

struct TlsMaterial {
    std::string caCertPath;
    std::string serverCertPath;
    std::string serverKeyPath;
};

// Loads the files from `directory`, creating whatever is missing. False with `error`
// set when OpenSSL or the file system fails.
bool loadOrCreateLocalTlsMaterial(const std::string& directory, TlsMaterial& out,
                                  std::string& error);

}  // namespace qax
