// Obtains the device attestation key and certificate chain for one coverage request and
// turns them into the request's two attestation headers. One manager per request, always
// held by shared pointer: generateKVACertficate blocks the calling thread (at most the
// issuance time limit) while the service issues; the service's completions run on its own
// thread, keep the manager alive and store into it under its lock.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <semaphore>
#include <string>
#include <string_view>
#include <vector>

#include "platform/AttestationService.h"

namespace qax {

class HttpRequest;

class QAXKVAManager : public std::enable_shared_from_this<QAXKVAManager> {
  public:
    using Signal = std::counting_semaphore<>;
    // Waits until `signal` is raised or `seconds` have passed; true when it was raised.
    using TimedWait = std::function<bool(Signal& signal, double seconds)>;
    using Completion = std::function<void(std::optional<CertificateChain> certificates,
                                          std::shared_ptr<AttestationKey> key,
                                          std::optional<AttestationError> error)>;

    // Both issuance attempts together must complete within this time.
    static constexpr int kIssuanceTimeLimitSeconds = 60;

    // `wait` defaults to a real-time wait on the signal.
    static std::shared_ptr<QAXKVAManager> create(std::shared_ptr<AttestationService> service,
                                                 TimedWait wait = {});

    // Issues the key and chain and stores them in the manager; true when both arrived in
    // time. `completion` (may be empty) runs on the service's thread once an attempt has
    // ended, unless the device has no attestation at all.
    bool generateKVACertficate(Completion completion);

    // Sets "X-Velmora-Kva-S" and "X-Velmora-Kva" from the stored key and chain; true when
    // both got a value. `error` is left as it is: each failure is logged where it arises.
    bool addKVAAuthenticationHeadersToRequest(HttpRequest& request, std::string_view body,
                                              std::optional<std::string>* error);

    // Base64 of the DER ECDSA signature of the SHA-256 digest of `data`.
    std::optional<std::string> signDataAndEncodeToBase64(
        std::string_view data, const std::shared_ptr<AttestationKey>& key);
    // Base64 of the raw DEFLATE form of {"certs": [base64 DER, ...]}.
    std::optional<std::string> certificatesEncodeToBase64(const CertificateChain& certificates);
    // Base64 of each certificate's DER bytes, in chain order; empty ones are skipped.
    std::vector<std::string> serializeCertificateChain(const CertificateChain& certificates);
    std::optional<Bytes> _compressCertificates(const std::vector<std::string>& certificates);
    // One raw DEFLATE stream in a buffer exactly as large as `data`; none when it does not fit.
    static std::optional<Bytes> _zlibCompressionForData(std::string_view data);

    // Diagnostic: writes the leaf and the intermediate to /tmp.
    void writeCertsToDevice(const CertificateChain& certificates);

    std::optional<CertificateChain> clientCertArray() const;
    std::shared_ptr<AttestationKey> privateKey() const;

  private:
    struct Attempt;

    QAXKVAManager(std::shared_ptr<AttestationService> service, TimedWait wait);
    void firstAttemptCompleted(const std::shared_ptr<Attempt>& attempt,
                               std::shared_ptr<AttestationKey> key,
                               std::optional<CertificateChain> certificates,
                               std::optional<AttestationError> error);
    void fallbackAttemptCompleted(const std::shared_ptr<Attempt>& attempt,
                                  std::shared_ptr<AttestationKey> key,
                                  std::optional<CertificateChain> certificates,
                                  std::optional<AttestationError> error);
    void store(std::shared_ptr<AttestationKey> key, CertificateChain certificates);
    void finish(const std::shared_ptr<Attempt>& attempt, std::optional<AttestationError> error);

    const std::shared_ptr<AttestationService> service_;
    const TimedWait wait_;

    mutable std::mutex mutex_;
    std::optional<CertificateChain> clientCertArray_;
    std::shared_ptr<AttestationKey> privateKey_;
    bool success_ = false;
};

}  // namespace qax
