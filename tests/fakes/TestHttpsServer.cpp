#include "fakes/TestHttpsServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <stdexcept>

#include "core/PlistCodec.h"

namespace qax::test {
namespace {

struct KeyDeleter {
    void operator()(EVP_PKEY* k) const { EVP_PKEY_free(k); }
};
struct CertDeleter {
    void operator()(X509* c) const { X509_free(c); }
};
using Key = std::unique_ptr<EVP_PKEY, KeyDeleter>;
using Cert = std::unique_ptr<X509, CertDeleter>;

Key newKey() {
    Key key(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
    if (!key) {
        throw std::runtime_error("EC key generation failed");
    }
    return key;
}

void addExtension(X509* cert, X509* issuer, int nid, const char* value) {
    X509V3_CTX ctx;
    X509V3_set_ctx_nodb(&ctx);
    X509V3_set_ctx(&ctx, issuer, cert, nullptr, nullptr, 0);
    X509_EXTENSION* ext = X509V3_EXT_conf_nid(nullptr, &ctx, nid, value);
    if (!ext) {
        throw std::runtime_error("bad certificate extension");
    }
    X509_add_ext(cert, ext, -1);
    X509_EXTENSION_free(ext);
}

// A certificate for `key`, signed by `issuerKey` (self-signed when `issuer` is null).
Cert newCertificate(EVP_PKEY* key, const char* commonName, X509* issuer, EVP_PKEY* issuerKey,
                    long serial) {
    Cert cert(X509_new());
    X509_set_version(cert.get(), 2);
    ASN1_INTEGER_set(X509_get_serialNumber(cert.get()), serial);
    X509_gmtime_adj(X509_getm_notBefore(cert.get()), -3600);
    X509_gmtime_adj(X509_getm_notAfter(cert.get()), 30L * 86400);
    X509_set_pubkey(cert.get(), key);
    X509_NAME* name = X509_get_subject_name(cert.get());
    X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC,
                               reinterpret_cast<const unsigned char*>(commonName), -1, -1, 0);
    X509* signer = issuer ? issuer : cert.get();
    X509_set_issuer_name(cert.get(), X509_get_subject_name(signer));
    addExtension(cert.get(), signer, NID_subject_key_identifier, "hash");
    if (!issuer) {
        addExtension(cert.get(), signer, NID_basic_constraints, "critical,CA:TRUE");
        addExtension(cert.get(), signer, NID_key_usage, "critical,keyCertSign,cRLSign");
    } else {
        addExtension(cert.get(), signer, NID_authority_key_identifier, "keyid");
        addExtension(cert.get(), signer, NID_basic_constraints, "critical,CA:FALSE");
        addExtension(cert.get(), signer, NID_key_usage, "critical,digitalSignature");
        addExtension(cert.get(), signer, NID_ext_key_usage, "serverAuth");
        addExtension(cert.get(), signer, NID_subject_alt_name, "DNS:localhost,IP:127.0.0.1");
    }
    if (X509_sign(cert.get(), issuerKey ? issuerKey : key, EVP_sha256()) == 0) {
        throw std::runtime_error("certificate signing failed");
    }
    return cert;
}

void writePem(const std::filesystem::path& path, X509* cert, EVP_PKEY* key) {
    std::FILE* f = std::fopen(path.c_str(), "w");
    if (!f) {
        throw std::runtime_error("cannot write " + path.string());
    }
    if (cert) {
        PEM_write_X509(f, cert);
    }
    if (key) {
        PEM_write_PrivateKey(f, key, nullptr, nullptr, 0, nullptr, nullptr);
    }
    std::fclose(f);
}

}  // namespace

TestHttpsServer::TestHttpsServer() {
    Key caKey = newKey();
    Cert ca = newCertificate(caKey.get(), "qax test CA", nullptr, nullptr, 1);
    Key serverKey = newKey();
    Cert leaf = newCertificate(serverKey.get(), "localhost", ca.get(), caKey.get(), 2);
    writePem(dir_.path() / "ca.pem", ca.get(), nullptr);
    writePem(dir_.path() / "server.pem", leaf.get(), nullptr);
    writePem(dir_.path() / "server-key.pem", nullptr, serverKey.get());
    server_ = std::make_unique<httplib::SSLServer>((dir_.path() / "server.pem").c_str(),
                                                   (dir_.path() / "server-key.pem").c_str());
    if (!server_->is_valid()) {
        throw std::runtime_error("the test HTTPS server could not load its certificate");
    }
    // Enough threads for the concurrency tests to hold many requests at once.
    server_->new_task_queue = [] { return new httplib::ThreadPool(32); };
}

TestHttpsServer::~TestHttpsServer() {
    stop();
}

void TestHttpsServer::start() {
    port_ = server_->bind_to_any_port("127.0.0.1");
    if (port_ <= 0) {
        throw std::runtime_error("the test HTTPS server could not bind");
    }
    thread_ = std::thread([this] { server_->listen_after_bind(); });
    for (int i = 0; i < 500 && !server_->is_running(); ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
}

void TestHttpsServer::stop() {
    if (thread_.joinable()) {
        server_->stop();
        thread_.join();
    }
}

std::string TestHttpsServer::url(const std::string& path) const {
    return "https://127.0.0.1:" + std::to_string(port_) + path;
}

std::string TestHttpsServer::caFile() const {
    return (dir_.path() / "ca.pem").string();
}

void TestHttpsServer::trustIn(const std::string& platformRoot) const {
    Value tls{Value::Dictionary{}};
    tls["ExtraCAFile"] = caFile();
    writeFile(std::filesystem::path(platformRoot) / "tls.plist", *toXmlPlist(tls));
}

int unusedLocalPort() {
    int fd = ::socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address));
    socklen_t length = sizeof(address);
    ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length);
    ::close(fd);
    return ntohs(address.sin_port);
}

}  // namespace qax::test
