#include "fakes/FakeAttestation.h"

namespace qax::test {
namespace {

class EmptyCertificate : public AttestationCertificate {
  public:
    Bytes certificateData() const override { return {}; }
};

}  // namespace

void ScriptedAttestationService::issueClientCertificate(const AttestationOptions& options,
                                                        Completion completion) {
    Step step;
    {
        std::lock_guard lock(mutex_);
        calls_.push_back(options);
        if (!script.empty()) {
            step = script.front();
            script.pop_front();
        }
        if (step.kind == Step::Never) {
            held_.emplace_back(options, std::move(completion));
            return;
        }
    }
    if (step.kind == Step::Fail) {
        threads_.run([completion = std::move(completion), code = step.code] {
            completion(nullptr, std::nullopt, AttestationError{code, "scripted failure"});
        });
        return;
    }
    // Every other step starts from the target's answer and changes it.
    target_->issueClientCertificate(
        options, [this, step, completion = std::move(completion)](
                     std::shared_ptr<AttestationKey> key, std::optional<CertificateChain> chain,
                     std::optional<AttestationError> error) mutable {
            switch (step.kind) {
                case Step::KeyOnly:
                    chain.reset();
                    break;
                case Step::EmptyChain:
                    chain = CertificateChain{};
                    break;
                case Step::NullLeaf:
                    if (chain && !chain->empty()) {
                        chain->front() = std::make_shared<EmptyCertificate>();
                    }
                    break;
                case Step::ForwardWithError:
                    error = AttestationError{step.code, "scripted failure"};
                    break;
                default:
                    break;
            }
            // Answer from a thread of the fake, not the target's, so drain() covers it.
            threads_.run([completion = std::move(completion), key = std::move(key),
                          chain = std::move(chain),
                          error = std::move(error)] { completion(key, chain, error); });
        });
}

void ScriptedAttestationService::releaseHeldCompletion() {
    std::pair<AttestationOptions, Completion> held;
    {
        std::lock_guard lock(mutex_);
        if (held_.empty()) {
            return;
        }
        held = std::move(held_.front());
        held_.erase(held_.begin());
    }
    target_->issueClientCertificate(held.first, std::move(held.second));
}

}  // namespace qax::test
