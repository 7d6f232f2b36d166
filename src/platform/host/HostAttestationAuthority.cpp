#include "platform/host/HostAttestationAuthority.h"

#include <fcntl.h>
#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/objects.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>
#include <sys/file.h>
#include <unistd.h>

#include <ctime>
#include <filesystem>

#include "core/AtomicFile.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

// The local CA is valid over a fixed, wide span (2001 to 2100) rather than from its creation,
// so that leaves dated by a clock that runs behind or ahead of the host's still chain up.
constexpr std::time_t kCANotBefore = 978307200;
constexpr double kCAValiditySeconds = 4102444800.0 - 978307200.0;
constexpr const char* kOrganization = "QAX Device Attestation";
constexpr const char* kRootName = "QAX Local Attestation Root CA";
constexpr const char* kIntermediateName = "QAX Local Attestation Intermediate CA";

struct PKeyFree {
    void operator()(EVP_PKEY* k) const { EVP_PKEY_free(k); }
};
struct X509Free {
    void operator()(X509* x) const { X509_free(x); }
};
struct BioFree {
    void operator()(BIO* b) const { BIO_free(b); }
};
struct ExtensionFree {
    void operator()(X509_EXTENSION* e) const { X509_EXTENSION_free(e); }
};
using PKeyPtr = std::unique_ptr<EVP_PKEY, PKeyFree>;
using X509Ptr = std::unique_ptr<X509, X509Free>;
using BioPtr = std::unique_ptr<BIO, BioFree>;
using ExtensionPtr = std::unique_ptr<X509_EXTENSION, ExtensionFree>;

std::string openSSLError(const std::string& what) {
    unsigned long code = ERR_get_error();
    ERR_clear_error();
    if (code == 0) {
        return what;
    }
    char buf[256];
    ERR_error_string_n(code, buf, sizeof buf);
    return what + ": " + buf;
}

bool fail(std::string* error, const std::string& what) {
    if (error) {
        *error = openSSLError(what);
    }
    return false;
}

// An advisory lock on a file next to what it guards, held for the object's life.
class FileLock {
  public:
    explicit FileLock(const fs::path& path) {
        std::error_code ec;
        fs::create_directories(path.parent_path(), ec);
        fd_ = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
        if (fd_ >= 0) {
            while (::flock(fd_, LOCK_EX) != 0 && errno == EINTR) {
            }
        }
    }
    ~FileLock() {
        if (fd_ >= 0) {
            ::close(fd_);
        }
    }
    FileLock(const FileLock&) = delete;
    FileLock& operator=(const FileLock&) = delete;

  private:
    int fd_ = -1;
};

PKeyPtr generateKey() {
    return PKeyPtr(EVP_EC_gen("P-256"));
}

PKeyPtr readKey(const fs::path& path) {
    auto pem = readWholeFile(path.string(), 1 << 20);
    if (!pem) {
        return nullptr;
    }
    BioPtr bio(BIO_new_mem_buf(pem->data(), static_cast<int>(pem->size())));
    return PKeyPtr(bio ? PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, nullptr) : nullptr);
}

X509Ptr readCertificate(const fs::path& path) {
    auto pem = readWholeFile(path.string(), 1 << 20);
    if (!pem) {
        return nullptr;
    }
    BioPtr bio(BIO_new_mem_buf(pem->data(), static_cast<int>(pem->size())));
    return X509Ptr(bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr) : nullptr);
}

std::string bioText(BIO* bio) {
    char* data = nullptr;
    long n = BIO_get_mem_data(bio, &data);
    return n > 0 ? std::string(data, static_cast<std::size_t>(n)) : std::string();
}

std::optional<std::string> keyPEM(EVP_PKEY* key) {
    BioPtr bio(BIO_new(BIO_s_mem()));
    if (!bio ||
        PEM_write_bio_PrivateKey(bio.get(), key, nullptr, nullptr, 0, nullptr, nullptr) != 1) {
        return std::nullopt;
    }
    return bioText(bio.get());
}

std::optional<std::string> certificatePEM(X509* certificate) {
    BioPtr bio(BIO_new(BIO_s_mem()));
    if (!bio || PEM_write_bio_X509(bio.get(), certificate) != 1) {
        return std::nullopt;
    }
    return bioText(bio.get());
}

bool writeKey(const fs::path& path, EVP_PKEY* key, std::string* error) {
    auto pem = keyPEM(key);
    if (!pem) {
        return fail(error, "cannot encode key for " + path.string());
    }
    return writeFileAtomically(path.string(), *pem, error, 0600);
}

bool writeCertificate(const fs::path& path, X509* certificate, std::string* error) {
    auto pem = certificatePEM(certificate);
    if (!pem) {
        return fail(error, "cannot encode certificate for " + path.string());
    }
    return writeFileAtomically(path.string(), *pem, error, 0644);
}

bool addStandardExtension(X509* certificate, X509V3_CTX& ctx, int nid, const char* value) {
    ExtensionPtr ext(X509V3_EXT_nconf_nid(nullptr, &ctx, nid, value));
    return ext && X509_add_ext(certificate, ext.get(), -1) == 1;
}

bool addCustomExtension(X509* certificate, const HostAttestationAuthority::Extension& extension) {
    std::unique_ptr<ASN1_OBJECT, decltype(&ASN1_OBJECT_free)> object(
        OBJ_txt2obj(extension.oid.c_str(), 1), ASN1_OBJECT_free);
    std::unique_ptr<ASN1_OCTET_STRING, decltype(&ASN1_OCTET_STRING_free)> value(
        ASN1_OCTET_STRING_new(), ASN1_OCTET_STRING_free);
    if (!object || !value ||
        ASN1_OCTET_STRING_set(value.get(), extension.der.data(),
                              static_cast<int>(extension.der.size())) != 1) {
        return false;
    }
    ExtensionPtr ext(X509_EXTENSION_create_by_OBJ(nullptr, object.get(), 0, value.get()));
    return ext && X509_add_ext(certificate, ext.get(), -1) == 1;
}

enum class Role { Root, Intermediate, Leaf };

// A certificate for `subjectKey`, signed by `issuerKey` (as `issuer`, or self-signed when
// `issuer` is null).
X509Ptr makeCertificate(EVP_PKEY* subjectKey, const std::string& commonName, X509* issuer,
                        EVP_PKEY* issuerKey, std::time_t notBefore, double validitySeconds,
                        Role role, const std::vector<HostAttestationAuthority::Extension>& extra) {
    X509Ptr x(X509_new());
    if (!x || X509_set_version(x.get(), X509_VERSION_3) != 1) {
        return nullptr;
    }
    std::unique_ptr<BIGNUM, decltype(&BN_free)> serial(BN_new(), BN_free);
    if (!serial || BN_rand(serial.get(), 63, BN_RAND_TOP_ANY, BN_RAND_BOTTOM_ANY) != 1 ||
        !BN_to_ASN1_INTEGER(serial.get(), X509_get_serialNumber(x.get()))) {
        return nullptr;
    }
    const auto notAfter =
        static_cast<std::time_t>(static_cast<double>(notBefore) + validitySeconds);
    if (!ASN1_TIME_set(X509_getm_notBefore(x.get()), notBefore) ||
        !ASN1_TIME_set(X509_getm_notAfter(x.get()), notAfter)) {
        return nullptr;
    }
    X509_NAME* name = X509_get_subject_name(x.get());
    auto text = [](const std::string& s) {
        return reinterpret_cast<const unsigned char*>(s.c_str());
    };
    if (X509_NAME_add_entry_by_txt(name, "O", MBSTRING_UTF8, text(kOrganization), -1, -1, 0) != 1 ||
        X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_UTF8, text(commonName), -1, -1, 0) != 1) {
        return nullptr;
    }
    if (X509_set_issuer_name(x.get(), issuer ? X509_get_subject_name(issuer) : name) != 1 ||
        X509_set_pubkey(x.get(), subjectKey) != 1) {
        return nullptr;
    }

    X509V3_CTX ctx;
    X509V3_set_ctx_nodb(&ctx);
    X509V3_set_ctx(&ctx, issuer ? issuer : x.get(), x.get(), nullptr, nullptr, 0);
    const char* constraints = role == Role::Root           ? "critical,CA:TRUE"
                              : role == Role::Intermediate ? "critical,CA:TRUE,pathlen:0"
                                                           : "critical,CA:FALSE";
    const char* usage =
        role == Role::Leaf ? "critical,digitalSignature" : "critical,keyCertSign,cRLSign";
    if (!addStandardExtension(x.get(), ctx, NID_basic_constraints, constraints) ||
        !addStandardExtension(x.get(), ctx, NID_key_usage, usage) ||
        !addStandardExtension(x.get(), ctx, NID_subject_key_identifier, "hash") ||
        !addStandardExtension(x.get(), ctx, NID_authority_key_identifier, "keyid:always")) {
        return nullptr;
    }
    for (const auto& extension : extra) {
        if (!addCustomExtension(x.get(), extension)) {
            return nullptr;
        }
    }
    if (X509_sign(x.get(), issuerKey, EVP_sha256()) <= 0) {
        return nullptr;
    }
    return x;
}

std::optional<std::vector<std::uint8_t>> derOf(X509* certificate) {
    int n = i2d_X509(certificate, nullptr);
    if (n <= 0) {
        return std::nullopt;
    }
    std::vector<std::uint8_t> out(static_cast<std::size_t>(n));
    unsigned char* p = out.data();
    if (i2d_X509(certificate, &p) != n) {
        return std::nullopt;
    }
    return out;
}

// Only letters, digits, '.', '-' and '_' name a file; anything else becomes '_'.
std::string fileNameForLabel(const std::string& label) {
    std::string out = label.empty() ? std::string("_") : label;
    for (char& c : out) {
        const bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
                        (c >= '0' && c <= '9') || c == '.' || c == '-' || c == '_';
        if (!ok) {
            c = '_';
        }
    }
    if (out.front() == '.') {
        out.front() = '_';
    }
    return out;
}

}  // namespace

struct HostAttestationAuthority::CA {
    PKeyPtr rootKey;
    X509Ptr root;
    PKeyPtr intermediateKey;
    X509Ptr intermediate;
};

HostAttestationAuthority::HostAttestationAuthority(std::string platformRoot)
    : root_(std::move(platformRoot)) {}

HostAttestationAuthority::~HostAttestationAuthority() = default;

std::string HostAttestationAuthority::rootCertificatePath() const {
    return (fs::path(root_) / "state" / "attestation" / "ca.pem").string();
}

std::string HostAttestationAuthority::keyPathForLabel(const std::string& label) const {
    return (fs::path(root_) / "state" / "keys" / (fileNameForLabel(label) + ".pem")).string();
}

bool HostAttestationAuthority::loadOrCreateCA(std::string* error) {
    if (ca_) {
        return true;
    }
    const fs::path dir = fs::path(root_) / "state" / "attestation";
    FileLock lock(dir / ".lock");
    auto ca = std::make_unique<CA>();

    ca->rootKey = readKey(dir / "ca-key.pem");
    ca->root = readCertificate(dir / "ca.pem");
    const bool rootMatches =
        ca->rootKey && ca->root && X509_check_private_key(ca->root.get(), ca->rootKey.get()) == 1;
    if (!rootMatches) {
        ca->rootKey = generateKey();
        if (!ca->rootKey) {
            return fail(error, "cannot generate the attestation root key");
        }
        ca->root = makeCertificate(ca->rootKey.get(), kRootName, nullptr, ca->rootKey.get(),
                                   kCANotBefore, kCAValiditySeconds, Role::Root, {});
        if (!ca->root) {
            return fail(error, "cannot make the attestation root certificate");
        }
        if (!writeKey(dir / "ca-key.pem", ca->rootKey.get(), error) ||
            !writeCertificate(dir / "ca.pem", ca->root.get(), error)) {
            return false;
        }
    }

    ca->intermediateKey = readKey(dir / "intermediate-key.pem");
    ca->intermediate = readCertificate(dir / "intermediate.pem");
    // A new root (or a foreign file) means a new intermediate.
    const bool intermediateMatches =
        ca->intermediateKey && ca->intermediate &&
        X509_check_private_key(ca->intermediate.get(), ca->intermediateKey.get()) == 1 &&
        X509_verify(ca->intermediate.get(), ca->rootKey.get()) == 1;
    if (!intermediateMatches) {
        ca->intermediateKey = generateKey();
        if (!ca->intermediateKey) {
            return fail(error, "cannot generate the attestation intermediate key");
        }
        ca->intermediate = makeCertificate(ca->intermediateKey.get(), kIntermediateName,
                                           ca->root.get(), ca->rootKey.get(), kCANotBefore,
                                           kCAValiditySeconds, Role::Intermediate, {});
        if (!ca->intermediate) {
            return fail(error, "cannot make the attestation intermediate certificate");
        }
        if (!writeKey(dir / "intermediate-key.pem", ca->intermediateKey.get(), error) ||
            !writeCertificate(dir / "intermediate.pem", ca->intermediate.get(), error)) {
            return false;
        }
    }
    ca_ = std::move(ca);
    return true;
}

std::shared_ptr<EVP_PKEY> HostAttestationAuthority::keyForLabel(const std::string& label,
                                                                std::string* error) {
    const fs::path path = keyPathForLabel(label);
    FileLock lock(path.parent_path() / ".lock");
    PKeyPtr key = readKey(path);
    if (!key) {
        key = generateKey();
        if (!key) {
            fail(error, "cannot generate a key for " + label);
            return nullptr;
        }
        if (!writeKey(path, key.get(), error)) {
            return nullptr;
        }
    }
    return std::shared_ptr<EVP_PKEY>(key.release(), PKeyFree());
}

std::optional<std::vector<std::uint8_t>> HostAttestationAuthority::issueLeaf(
    EVP_PKEY* key, const std::string& commonName, Date notBefore, double validitySeconds,
    const std::vector<Extension>& extensions, std::string* error) {
    std::lock_guard lock(mutex_);
    if (!loadOrCreateCA(error)) {
        return std::nullopt;
    }
    X509Ptr leaf =
        makeCertificate(key, commonName, ca_->intermediate.get(), ca_->intermediateKey.get(),
                        static_cast<std::time_t>(notBefore.secondsSince1970()), validitySeconds,
                        Role::Leaf, extensions);
    if (!leaf) {
        fail(error, "cannot issue a leaf certificate");
        return std::nullopt;
    }
    return derOf(leaf.get());
}

std::optional<std::vector<std::uint8_t>> HostAttestationAuthority::intermediateCertificateDER(
    std::string* error) {
    std::lock_guard lock(mutex_);
    if (!loadOrCreateCA(error)) {
        return std::nullopt;
    }
    return derOf(ca_->intermediate.get());
}

std::optional<std::string> HostAttestationAuthority::rootCertificatePEM(std::string* error) {
    std::lock_guard lock(mutex_);
    if (!loadOrCreateCA(error)) {
        return std::nullopt;
    }
    return certificatePEM(ca_->root.get());
}

}  // namespace qax
