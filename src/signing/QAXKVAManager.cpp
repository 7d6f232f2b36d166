#include "signing/QAXKVAManager.h"

#include <zlib.h>

#include <chrono>

#include "core/AtomicFile.h"
#include "core/Base64.h"
#include "core/JsonCodec.h"
#include "core/Log.h"
#include "core/Value.h"
#include "platform/HttpClient.h"

namespace qax {
namespace {

constexpr const char* kGenerateName = "-[QAXKVAManager generateKVACertficate:]";
constexpr const char* kFirstCompletionName = "-[QAXKVAManager generateKVACertficate:]_completion";
constexpr const char* kAddHeadersName =
    "-[QAXKVAManager addKVAAuthenticationHeadersToRequest:withBody:error:]";
constexpr const char* kSerializeName = "-[QAXKVAManager serializeCertificateChain:]";

constexpr const char* kKeyStoreLabel = "com.velmora.qaxagent.kvaCertificates";
constexpr const char* kKeyStoreAccessGroup = "com.velmora.qaxagent";
constexpr double kNetworkTimeoutInterval = 60;
constexpr std::int64_t kCertificateValidity = 43200;

constexpr const char* kSignatureHeader = "X-Velmora-Kva-S";
constexpr const char* kCertificatesHeader = "X-Velmora-Kva";

bool waitInRealTime(QAXKVAManager::Signal& signal, double seconds) {
    return signal.try_acquire_for(std::chrono::duration<double>(seconds));
}

// A raw DEFLATE stream kept per thread: initialising one costs more than compressing a
// certificate chain, so each thread resets and reuses its own.
class DeflateStream {
  public:
    DeflateStream() {
        ready_ = deflateInit2(&stream_, Z_DEFAULT_COMPRESSION, Z_DEFLATED, -MAX_WBITS, 8,
                              Z_DEFAULT_STRATEGY) == Z_OK;
    }
    ~DeflateStream() {
        if (ready_) {
            deflateEnd(&stream_);
        }
    }
    DeflateStream(const DeflateStream&) = delete;
    DeflateStream& operator=(const DeflateStream&) = delete;

    // Bytes written into `out`, or 0 when the whole stream did not fit.
    std::size_t compress(std::string_view in, Bytes& out) {
        if (!ready_ || deflateReset(&stream_) != Z_OK) {
            return 0;
        }
        stream_.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(in.data()));
        stream_.avail_in = static_cast<uInt>(in.size());
        stream_.next_out = out.data();
        stream_.avail_out = static_cast<uInt>(out.size());
        if (deflate(&stream_, Z_FINISH) != Z_STREAM_END) {
            return 0;
        }
        return static_cast<std::size_t>(stream_.total_out);
    }

  private:
    z_stream stream_{};
    bool ready_ = false;
};

}  // namespace

// The options and the caller's completion, shared by both issuance attempts.
struct QAXKVAManager::Attempt {
    AttestationOptions options;
    Completion completion;
    std::shared_ptr<Signal> signal;
};

std::shared_ptr<QAXKVAManager> QAXKVAManager::create(std::shared_ptr<AttestationService> service,
                                                     TimedWait wait) {
    return std::shared_ptr<QAXKVAManager>(new QAXKVAManager(std::move(service), std::move(wait)));
}

QAXKVAManager::QAXKVAManager(std::shared_ptr<AttestationService> service, TimedWait wait)
    : service_(std::move(service)), wait_(wait ? std::move(wait) : TimedWait(waitInRealTime)) {}

bool QAXKVAManager::generateKVACertficate(Completion completion) {
    const bool supported = service_ && service_->isAttestationSupported();
    qaxLog().info("%s: veridonSupported on this device:%d", kGenerateName, supported);
    if (!supported) {
        return false;
    }
    std::string accessError;
    auto accessControl = service_->createPrivateKeyAccessControl(
        KeyAccessibility::AfterFirstUnlockThisDeviceOnly, &accessError);
    if (!accessControl) {
        qaxLog().error("Failed to create access control: %s", accessError);
        return false;
    }

    auto attempt = std::make_shared<Attempt>();
    attempt->completion = std::move(completion);
    attempt->signal = std::make_shared<Signal>(0);
    AttestationOptions& options = attempt->options;
    options.keyStoreLabel = kKeyStoreLabel;
    options.keyStoreAccessGroup = kKeyStoreAccessGroup;
    options.includeCACertificate = true;
    options.networkTimeoutInterval = kNetworkTimeoutInterval;
    options.svxtAttestation = false;
    options.validity = kCertificateValidity;
    options.accessControls = accessControl;
    options.oidsToInclude = {AttestationOID::UVXTDeviceIdentifiers,
                             AttestationOID::DeviceIdentifiers, AttestationOID::HardwareProperties,
                             AttestationOID::AccessControls, AttestationOID::DeviceOSInformation};

    // The signal is shared, not owned by this frame: a late completion still raises it.
    std::shared_ptr<Signal> signal = attempt->signal;
    service_->issueClientCertificate(
        attempt->options,
        [self = shared_from_this(), attempt](auto key, auto certificates, auto error) {
            self->firstAttemptCompleted(attempt, std::move(key), std::move(certificates),
                                        std::move(error));
        });
    if (!wait_(*signal, kIssuanceTimeLimitSeconds)) {
        qaxLog().info("%s: Installation timed out after %d seconds", kGenerateName,
                      kIssuanceTimeLimitSeconds);
    }
    accessControl.reset();
    std::lock_guard lock(mutex_);
    return success_;
}

void QAXKVAManager::firstAttemptCompleted(const std::shared_ptr<Attempt>& attempt,
                                          std::shared_ptr<AttestationKey> key,
                                          std::optional<CertificateChain> certificates,
                                          std::optional<AttestationError> error) {
    if (error) {
        if (service_->isMissingUVXTError(*error)) {
            qaxLog().error(
                "%s: KVA (UVXT) failed due to missing UVXT with error: %@, falling back to KVA "
                "(SVXT)",
                kFirstCompletionName, *error);
            attempt->options.svxtAttestation = true;
            service_->issueClientCertificate(
                attempt->options,
                [self = shared_from_this(), attempt](auto key, auto certificates, auto error) {
                    self->fallbackAttemptCompleted(attempt, std::move(key), std::move(certificates),
                                                   std::move(error));
                });
            return;
        }
        if (attempt->completion) {
            attempt->completion(std::nullopt, nullptr, std::move(error));
        }
        attempt->signal->release();
        return;
    }
    if (key && certificates) {
        store(std::move(key), std::move(*certificates));
    } else {
        qaxLog().error("%s: Failed to get reference key or cert!", kFirstCompletionName);
    }
    finish(attempt, std::nullopt);
}

void QAXKVAManager::fallbackAttemptCompleted(const std::shared_ptr<Attempt>& attempt,
                                             std::shared_ptr<AttestationKey> key,
                                             std::optional<CertificateChain> certificates,
                                             std::optional<AttestationError> error) {
    // A key and chain count even when the service also reports an error.
    if (key && certificates) {
        store(std::move(key), std::move(*certificates));
    }
    finish(attempt, std::move(error));
}

void QAXKVAManager::store(std::shared_ptr<AttestationKey> key, CertificateChain certificates) {
    std::lock_guard lock(mutex_);
    privateKey_ = std::move(key);
    clientCertArray_ = std::move(certificates);
    success_ = true;
}

void QAXKVAManager::finish(const std::shared_ptr<Attempt>& attempt,
                           std::optional<AttestationError> error) {
    if (attempt->completion) {
        attempt->completion(clientCertArray(), privateKey(), std::move(error));
    }
    attempt->signal->release();
}

bool QAXKVAManager::addKVAAuthenticationHeadersToRequest(HttpRequest& request,
                                                         std::string_view body,
                                                         std::optional<std::string>* error) {
    auto signature = signDataAndEncodeToBase64(body, privateKey());
    auto chain = clientCertArray();
    auto certificates = certificatesEncodeToBase64(chain ? *chain : CertificateChain{});
    request.setValue(kSignatureHeader, signature);
    request.setValue(kCertificatesHeader, certificates);
    if (signature && certificates) {
        qaxLog().info("%s: signatureDataString: %@\n certificateString: %@", kAddHeadersName,
                      *signature, *certificates);
        return true;
    }
    qaxLog().error("%s: Failed to add Kva Headers with error: %@", kAddHeadersName,
                   error ? *error : std::nullopt);
    return false;
}

std::optional<std::string> QAXKVAManager::signDataAndEncodeToBase64(
    std::string_view data, const std::shared_ptr<AttestationKey>& key) {
    if (!key) {
        return std::nullopt;
    }
    std::string error;
    auto signature =
        key->createSignature(SignatureAlgorithm::ECDSASignatureMessageX962SHA256,
                             std::span<const std::uint8_t>(
                                 reinterpret_cast<const std::uint8_t*>(data.data()), data.size()),
                             &error);
    if (!signature) {
        if (!error.empty()) {
            qaxLog().error("Unable to sign data and encode with error: %@", error);
        }
        return std::nullopt;
    }
    return base64Encode(*signature);
}

std::optional<std::string> QAXKVAManager::certificatesEncodeToBase64(
    const CertificateChain& certificates) {
    auto compressed = _compressCertificates(serializeCertificateChain(certificates));
    if (!compressed) {
        qaxLog().error("Unable to sign request");
        return std::nullopt;
    }
    return base64Encode(*compressed);
}

std::vector<std::string> QAXKVAManager::serializeCertificateChain(
    const CertificateChain& certificates) {
    std::vector<std::string> out;
    for (const auto& certificate : certificates) {
        Bytes der = certificate ? certificate->certificateData() : Bytes{};
        if (der.empty()) {
            qaxLog().error("%s: Found NULL attestation data!!", kSerializeName);
            continue;
        }
        out.push_back(base64Encode(der));
    }
    return out;
}

std::optional<Bytes> QAXKVAManager::_compressCertificates(
    const std::vector<std::string>& certificates) {
    Value::Array list(certificates.begin(), certificates.end());
    std::string json;
    try {
        json = toJsonString(Value(Value::Dictionary{{"certs", Value(std::move(list))}}));
    } catch (const std::exception& e) {
        qaxLog().error("Unable to create attestation data with error: %@", e.what());
        return std::nullopt;
    }
    if (json.empty()) {
        return std::nullopt;
    }
    return _zlibCompressionForData(json);
}

std::optional<Bytes> QAXKVAManager::_zlibCompressionForData(std::string_view data) {
    thread_local DeflateStream stream;
    Bytes out(data.size());
    const std::size_t written = out.empty() ? 0 : stream.compress(data, out);
    if (written == 0) {
        return std::nullopt;
    }
    out.resize(written);
    return out;
}

void QAXKVAManager::writeCertsToDevice(const CertificateChain& certificates) {
    if (certificates.size() <= 1) {
        qaxLog().debug("QAXKVAManager: Certificates not present!");
        return;
    }
    auto write = [](const char* path, const std::shared_ptr<AttestationCertificate>& c) {
        Bytes der = c ? c->certificateData() : Bytes{};
        writeFileAtomically(
            path, std::string_view(reinterpret_cast<const char*>(der.data()), der.size()), nullptr);
    };
    write("/tmp/leafCertificate", certificates[0]);
    write("/tmp/intermediateCertificate", certificates[1]);
}

std::optional<CertificateChain> QAXKVAManager::clientCertArray() const {
    std::lock_guard lock(mutex_);
    return clientCertArray_;
}

std::shared_ptr<AttestationKey> QAXKVAManager::privateKey() const {
    std::lock_guard lock(mutex_);
    return privateKey_;
}

}  // namespace qax
