#include "platform/host/LocalTlsMaterial.h"

#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>

#include <filesystem>
#include <memory>

#include "core/AtomicFile.h"

namespace qax {
namespace {

struct Free {
    void operator()(EVP_PKEY* p) const { EVP_PKEY_free(p); }
    void operator()(X509* p) const { X509_free(p); }
    void operator()(BIO* p) const { BIO_free(p); }
};
using Key = std::unique_ptr<EVP_PKEY, Free>;
using Cert = std::unique_ptr<X509, Free>;
using Bio = std::unique_ptr<BIO, Free>;

constexpr long kValiditySeconds = 10L * 365 * 24 * 3600;

Key newKey() {
    return Key(EVP_EC_gen("P-256"));
}

bool addExtension(X509* cert, X509* issuer, int nid, const char* value) {
    X509V3_CTX ctx;
    X509V3_set_ctx_nodb(&ctx);
    X509V3_set_ctx(&ctx, issuer, cert, nullptr, nullptr, 0);
    X509_EXTENSION* ext = X509V3_EXT_conf_nid(nullptr, &ctx, nid, value);
    if (!ext) {
        return false;
    }
    bool ok = X509_add_ext(cert, ext, -1) == 1;
    X509_EXTENSION_free(ext);
    return ok;
}

Cert makeCertificate(EVP_PKEY* key, const char* commonName, X509* issuer, EVP_PKEY* issuerKey,
                     bool isCA, long serial) {
    Cert cert(X509_new());
    if (!cert) {
        return nullptr;
    }
    X509_set_version(cert.get(), 2);
    ASN1_INTEGER_set(X509_get_serialNumber(cert.get()), serial);
    X509_gmtime_adj(X509_getm_notBefore(cert.get()), -3600);
    X509_gmtime_adj(X509_getm_notAfter(cert.get()), kValiditySeconds);
    X509_set_pubkey(cert.get(), key);
    X509_NAME* name = X509_get_subject_name(cert.get());
    X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC,
                               reinterpret_cast<const unsigned char*>(commonName), -1, -1, 0);
    X509* issuerCert = issuer ? issuer : cert.get();
    X509_set_issuer_name(cert.get(), X509_get_subject_name(issuerCert));
    bool ok = true;
    if (isCA) {
        ok = addExtension(cert.get(), issuerCert, NID_basic_constraints, "critical,CA:TRUE") &&
             addExtension(cert.get(), issuerCert, NID_key_usage, "critical,keyCertSign,cRLSign");
    } else {
        ok = addExtension(cert.get(), issuerCert, NID_basic_constraints, "critical,CA:FALSE") &&
             addExtension(cert.get(), issuerCert, NID_subject_alt_name,
                          "DNS:localhost,IP:127.0.0.1,IP:::1") &&
             addExtension(cert.get(), issuerCert, NID_ext_key_usage, "serverAuth");
    }
    if (!ok || X509_sign(cert.get(), issuerKey ? issuerKey : key, EVP_sha256()) <= 0) {
        return nullptr;
    }
    return cert;
}

template <typename F>
std::string toPem(F write) {
    Bio bio(BIO_new(BIO_s_mem()));
    if (!bio || write(bio.get()) != 1) {
        return {};
    }
    char* data = nullptr;
    long len = BIO_get_mem_data(bio.get(), &data);
    return std::string(data, static_cast<std::size_t>(len));
}

Key readKey(const std::string& path) {
    auto pem = readWholeFile(path);
    if (!pem) {
        return nullptr;
    }
    Bio bio(BIO_new_mem_buf(pem->data(), static_cast<int>(pem->size())));
    return Key(PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, nullptr));
}

Cert readCert(const std::string& path) {
    auto pem = readWholeFile(path);
    if (!pem) {
        return nullptr;
    }
    Bio bio(BIO_new_mem_buf(pem->data(), static_cast<int>(pem->size())));
    return Cert(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
}

bool writeKey(const std::string& path, EVP_PKEY* key, std::string& error) {
    auto pem = toPem([&](BIO* b) {
        return PEM_write_bio_PrivateKey(b, key, nullptr, nullptr, 0, nullptr, nullptr);
    });
    return !pem.empty() && writeFileAtomically(path, pem, &error, 0600);
}

bool writeCert(const std::string& path, X509* cert, std::string& error) {
    auto pem = toPem([&](BIO* b) { return PEM_write_bio_X509(b, cert); });
    return !pem.empty() && writeFileAtomically(path, pem, &error, 0644);
}

}  // namespace

bool loadOrCreateLocalTlsMaterial(const std::string& directory, TlsMaterial& out,
                                  std::string& error) {
    const std::filesystem::path dir(directory);
    out.caCertPath = (dir / "ca.pem").string();
    out.serverCertPath = (dir / "server.pem").string();
    out.serverKeyPath = (dir / "server-key.pem").string();
    const std::string caKeyPath = (dir / "ca-key.pem").string();

    Key caKey = readKey(caKeyPath);
    Cert caCert = readCert(out.caCertPath);
    if (!caKey || !caCert) {
        caKey = newKey();
        caCert = caKey ? makeCertificate(caKey.get(), "qax local CA", nullptr, nullptr, true, 1)
                       : nullptr;
        if (!caCert || !writeKey(caKeyPath, caKey.get(), error) ||
            !writeCert(out.caCertPath, caCert.get(), error)) {
            error = "cannot create the simulator's CA: " + error;
            return false;
        }
        std::filesystem::remove(out.serverCertPath);
    }
    if (readKey(out.serverKeyPath) && readCert(out.serverCertPath)) {
        return true;
    }
    Key serverKey = newKey();
    Cert serverCert = serverKey ? makeCertificate(serverKey.get(), "localhost", caCert.get(),
                                                  caKey.get(), false, 2)
                                : nullptr;
    if (!serverCert || !writeKey(out.serverKeyPath, serverKey.get(), error) ||
        !writeCert(out.serverCertPath, serverCert.get(), error)) {
        error = "cannot create the simulator's server certificate: " + error;
        return false;
    }
    return true;
}

}  // namespace qax
