// A test double of the attestation service over a real target: it answers each issuance from a
// script (forward to the target, fail with a code, hand out a key without a chain, or never
// answer), on threads of its own, and records the options it was given. Thread-safe.
#pragma once

#include <deque>
#include <mutex>
#include <vector>

#include "fakes/FakeAccounts.h"
#include "platform/AttestationService.h"

namespace qax::test {

class ScriptedAttestationService : public AttestationService {
  public:
    struct Step {
        enum Kind {
            Forward,           // the target issues
            Fail,              // error `code`, no key, no chain
            KeyOnly,           // the target's key, no chain, no error
            EmptyChain,        // the target's key and an empty chain
            NullLeaf,          // the target's chain with the leaf's bytes missing
            ForwardWithError,  // the target's key and chain, and error `code` as well
            Never,             // the completion is kept and never called
        } kind = Forward;
        long code = 0;
    };

    explicit ScriptedAttestationService(std::shared_ptr<AttestationService> target)
        : target_(std::move(target)) {}

    bool isAttestationSupported() override { return supported; }
    std::shared_ptr<const AccessControl> createPrivateKeyAccessControl(
        KeyAccessibility accessibility, std::string* error) override {
        if (accessControlFails && error) {
            *error = "access control refused";
        }
        return accessControlFails ? nullptr
                                  : target_->createPrivateKeyAccessControl(accessibility, error);
    }
    // Takes the next step of the script (Forward once the script is used up).
    void issueClientCertificate(
        const AttestationOptions& options,
        std::function<void(std::shared_ptr<AttestationKey>, std::optional<CertificateChain>,
                           std::optional<AttestationError>)>
            completion) override;
    bool isMissingUVXTError(const AttestationError& error) override {
        return target_->isMissingUVXTError(error);
    }

    // Joins the threads that ran completions.
    void drain() { threads_.drain(); }
    std::vector<AttestationOptions> calls() {
        std::lock_guard lock(mutex_);
        return calls_;
    }
    // Calls the kept completion of a Never step now, with the target's answer.
    void releaseHeldCompletion();

    bool supported = true;
    bool accessControlFails = false;
    std::deque<Step> script;

  private:
    using Completion =
        std::function<void(std::shared_ptr<AttestationKey>, std::optional<CertificateChain>,
                           std::optional<AttestationError>)>;

    std::shared_ptr<AttestationService> target_;
    std::mutex mutex_;
    std::vector<AttestationOptions> calls_;
    std::vector<std::pair<AttestationOptions, Completion>> held_;
    TaskThreads threads_;
};

}  // namespace qax::test
