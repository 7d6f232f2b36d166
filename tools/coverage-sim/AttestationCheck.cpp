#include "AttestationCheck.h"

#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509_vfy.h>
#include <zlib.h>

#include <memory>
#include <vector>

#include "core/Base64.h"
#include "core/JsonCodec.h"

namespace coveragesim {
namespace {

struct Free {
    void operator()(X509* p) const { X509_free(p); }
    void operator()(X509_STORE* p) const { X509_STORE_free(p); }
    void operator()(X509_STORE_CTX* p) const { X509_STORE_CTX_free(p); }
    void operator()(STACK_OF(X509) * p) const { sk_X509_pop_free(p, X509_free); }
    void operator()(EVP_MD_CTX* p) const { EVP_MD_CTX_free(p); }
    void operator()(BIO* p) const { BIO_free(p); }
};

std::optional<std::string> inflateRaw(const std::vector<std::uint8_t>& input) {
    z_stream zs{};
    if (inflateInit2(&zs, -MAX_WBITS) != Z_OK) {
        return std::nullopt;
    }
    std::string out;
    zs.next_in = const_cast<Bytef*>(input.data());
    zs.avail_in = static_cast<uInt>(input.size());
    char buf[16384];
    int rc = Z_OK;
    while (rc == Z_OK) {
        zs.next_out = reinterpret_cast<Bytef*>(buf);
        zs.avail_out = sizeof buf;
        rc = inflate(&zs, Z_NO_FLUSH);
        out.append(buf, sizeof buf - zs.avail_out);
        if (out.size() > (1 << 20)) {
            rc = Z_DATA_ERROR;
        }
    }
    inflateEnd(&zs);
    if (rc != Z_STREAM_END) {
        return std::nullopt;
    }
    return out;
}

X509* parseDer(const std::vector<std::uint8_t>& der) {
    const unsigned char* p = der.data();
    return d2i_X509(nullptr, &p, static_cast<long>(der.size()));
}

}  // namespace

AttestationVerdict checkAttestation(const std::optional<std::string>& signatureHeader,
                                    const std::optional<std::string>& certificatesHeader,
                                    const std::string& body, const std::string& rootPem,
                                    double verifyAt) {
    AttestationVerdict v;
    v.present = signatureHeader.has_value() && certificatesHeader.has_value();
    if (!v.present) {
        v.reason = "attestation headers absent";
        return v;
    }
    auto compressed = qax::base64Decode(*certificatesHeader);
    auto json = compressed ? inflateRaw(*compressed) : std::nullopt;
    auto list = json ? qax::parseJson(*json) : std::nullopt;
    const qax::Value* certs = list ? list->find("certs") : nullptr;
    if (!certs || !certs->isArray() || certs->size() == 0) {
        v.reason = "certificate list is not base64 raw DEFLATE of {\"certs\": [...]}";
        return v;
    }
    std::unique_ptr<STACK_OF(X509), Free> chain(sk_X509_new_null());
    std::unique_ptr<X509, Free> leaf;
    for (const auto& entry : *certs->asArray()) {
        auto der = entry.asString() ? qax::base64Decode(*entry.asString()) : std::nullopt;
        X509* cert = der ? parseDer(*der) : nullptr;
        if (!cert) {
            v.reason = "a certificate of the list is not base64 DER";
            return v;
        }
        if (!leaf) {
            leaf.reset(cert);
        } else {
            sk_X509_push(chain.get(), cert);
        }
    }
    char subject[256] = {0};
    X509_NAME_oneline(X509_get_subject_name(leaf.get()), subject, sizeof subject);
    v.leafSubject = subject;

    if (!rootPem.empty()) {
        std::unique_ptr<BIO, Free> bio(
            BIO_new_mem_buf(rootPem.data(), static_cast<int>(rootPem.size())));
        std::unique_ptr<X509, Free> root(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
        std::unique_ptr<X509_STORE, Free> store(X509_STORE_new());
        std::unique_ptr<X509_STORE_CTX, Free> ctx(X509_STORE_CTX_new());
        if (!root || !store || !ctx || X509_STORE_add_cert(store.get(), root.get()) != 1 ||
            X509_STORE_CTX_init(ctx.get(), store.get(), leaf.get(), chain.get()) != 1) {
            v.reason = "cannot set up chain verification";
            return v;
        }
        // The leaf carries the device's private extensions, which no verifier knows.
        X509_STORE_CTX_set_flags(ctx.get(), X509_V_FLAG_IGNORE_CRITICAL);
        X509_STORE_CTX_set_time(ctx.get(), 0, static_cast<time_t>(verifyAt));
        if (X509_verify_cert(ctx.get()) != 1) {
            v.reason = std::string("chain does not verify: ") +
                       X509_verify_cert_error_string(X509_STORE_CTX_get_error(ctx.get()));
            return v;
        }
    }

    auto signature = qax::base64Decode(*signatureHeader);
    std::unique_ptr<EVP_MD_CTX, Free> md(EVP_MD_CTX_new());
    EVP_PKEY* pub = X509_get0_pubkey(leaf.get());
    if (!signature || !md || !pub ||
        EVP_DigestVerifyInit(md.get(), nullptr, EVP_sha256(), nullptr, pub) != 1 ||
        EVP_DigestVerify(md.get(), signature->data(), signature->size(),
                         reinterpret_cast<const unsigned char*>(body.data()), body.size()) != 1) {
        v.reason = "signature does not verify over the body with the leaf key";
        return v;
    }
    v.valid = true;
    return v;
}

}  // namespace coveragesim
