// The simulator's TLS identity: a self-signed CA and a server certificate for localhost and
// 127.0.0.1 issued by it, kept as PEM files in the state directory and reused across runs.
// Clients trust the CA through the platform root's tls.plist. Used once at start-up.
#pragma once

#include <string>

namespace coveragesim {

struct TlsMaterial {
    std::string caCertPath;
    std::string serverCertPath;
    std::string serverKeyPath;
};

// Loads the files from `stateDirectory`, creating whatever is missing. False with `error`
// set when OpenSSL or the file system fails.
bool loadOrCreateTlsMaterial(const std::string& stateDirectory, TlsMaterial& out,
                             std::string& error);

}  // namespace coveragesim
