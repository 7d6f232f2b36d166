// Test doubles of the account store and the identity headers. Completions run on threads of
// the fake's own (joined when the fake goes), as the platform's do, so that a caller that
// blocks waiting for one is exercised for real. Thread-safe.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/AccountStore.h"
#include "platform/HttpClient.h"
#include "platform/IdentityAccountManager.h"

namespace qax::test {

// Runs tasks on threads of its own; joins them all on drain() and at destruction.
class TaskThreads {
  public:
    ~TaskThreads() { drain(); }
    void run(std::function<void()> task) {
        std::lock_guard lock(mutex_);
        threads_.emplace_back(std::move(task));
    }
    void drain() {
        for (;;) {
            std::vector<std::thread> threads;
            {
                std::lock_guard lock(mutex_);
                threads.swap(threads_);
            }
            if (threads.empty()) {
                return;
            }
            for (auto& t : threads) {
                t.join();
            }
        }
    }

  private:
    std::mutex mutex_;
    std::vector<std::thread> threads_;
};

// A signed-in user with a KF account, a stored token and a store account.
class FakeAccountStore : public AccountStore {
  public:
    static constexpr const char* kKFService = "com.velmora.kf.supportapp.auth";

    std::shared_ptr<const Account> primaryCloudAccount() override { return primary; }
    std::shared_ptr<const Account> kfAccountForCloudAccount(const Account&) override { return kf; }
    std::optional<std::string> credentialTokenForAccount(const Account&,
                                                         const std::string& service) override {
        std::lock_guard lock(mutex_);
        auto it = tokens_.find(service);
        return it == tokens_.end() ? std::nullopt : std::optional<std::string>(it->second);
    }
    void renewCredentialsForAccount(
        const Account&, const CredentialRenewalOptions& options,
        std::function<void(long, std::optional<std::string>)> completion) override {
        std::lock_guard lock(mutex_);
        renewals_.push_back(options);
        threads_.run([this, answer = renewal, services = options.services,
                      completion = std::move(completion)] {
            for (const auto& service : answer.code == 0 ? services : std::vector<std::string>{}) {
                setToken(answer.token, service);
            }
            completion(answer.code, answer.error);
        });
    }
    std::shared_ptr<const Account> ostaraAccountForCloudAccount(const Account&) override {
        std::lock_guard lock(mutex_);
        ++ostaraLookups_;
        return ostara;
    }
    void authenticateSilently(
        const Account&, const std::string& debugReason,
        std::function<void(std::shared_ptr<const Account>, std::optional<std::string>)> completion)
        override {
        std::lock_guard lock(mutex_);
        silentReasons_.push_back(debugReason);
        threads_.run([account = silentAccount, error = silentAccount ? std::nullopt : silentError,
                      completion = std::move(completion)] { completion(account, error); });
    }

    // None removes the stored token.
    void setToken(std::optional<std::string> token, const std::string& service = kKFService) {
        std::lock_guard lock(mutex_);
        if (token) {
            tokens_[service] = *token;
        } else {
            tokens_.erase(service);
        }
    }

    // The answer of the next renewals: a result code, a reason, and the token stored when
    // the code is 0 (none: the stored token is removed).
    struct Renewal {
        long code = 0;
        std::optional<std::string> error;
        std::optional<std::string> token = std::string("renewed-token");
    };

    std::shared_ptr<const Account> primary =
        std::make_shared<Account>(Account{"primary-altdsid", std::nullopt, std::nullopt});
    std::shared_ptr<const Account> kf =
        std::make_shared<Account>(Account{"kf-altdsid", std::nullopt, std::nullopt});
    std::shared_ptr<const Account> ostara =
        std::make_shared<Account>(Account{std::nullopt, "143441-1,29", 12345});
    std::shared_ptr<const Account> silentAccount;
    std::optional<std::string> silentError = std::string("silent authentication failed");
    Renewal renewal;

    std::vector<CredentialRenewalOptions> renewals() { return locked(renewals_); }
    std::vector<std::string> silentReasons() { return locked(silentReasons_); }
    int ostaraLookups() { return locked(ostaraLookups_); }

  private:
    template <typename T>
    T locked(const T& value) {
        std::lock_guard lock(mutex_);
        return value;
    }

    std::mutex mutex_;
    std::map<std::string, std::string> tokens_{{kKFService, "stored-token"}};
    std::vector<CredentialRenewalOptions> renewals_;
    std::vector<std::string> silentReasons_;
    int ostaraLookups_ = 0;
    TaskThreads threads_;
};

class FakeIdentityAccountManager : public IdentityAccountManager {
  public:
    void addClientInfoHeader(HttpRequest& request) override {
        request.setValue("X-Fake-Client-Info", std::string("client-info"));
    }
    void addDeviceUDIDHeader(HttpRequest& request) override {
        request.setValue("X-Fake-UDID", std::string("device-udid"));
    }
    std::map<std::string, std::string> identityHeadersForRequest(const HttpRequest&) override {
        return extraHeaders;
    }

    std::map<std::string, std::string> extraHeaders{{"X-Fake-Identity", "identity-value"}};
};

}  // namespace qax::test
