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
#include "platform/IdentityAccountManager.h"

namespace qax::test {

// Runs tasks on threads of its own; joins them all on drain() and at destruction.
class TaskThreads {
  public:
    ~TaskThreads() { drain(); }
    void run(std::function<void()> task);
    void drain();

  private:
    std::mutex mutex_;
    std::vector<std::thread> threads_;
};

class FakeAccountStore : public AccountStore {
  public:
    static constexpr const char* kKFService = "com.velmora.kf.supportapp.auth";

    // A signed-in user with a KF account, a stored token and a store account.
    FakeAccountStore();

    std::shared_ptr<const Account> primaryCloudAccount() override;
    std::shared_ptr<const Account> kfAccountForCloudAccount(const Account& cloudAccount) override;
    std::optional<std::string> credentialTokenForAccount(const Account& kfAccount,
                                                         const std::string& service) override;
    void renewCredentialsForAccount(
        const Account& kfAccount, const CredentialRenewalOptions& options,
        std::function<void(long, std::optional<std::string>)> completion) override;
    std::shared_ptr<const Account> ostaraAccountForCloudAccount(
        const Account& cloudAccount) override;
    void authenticateSilently(
        const Account& cloudAccount, const std::string& debugReason,
        std::function<void(std::shared_ptr<const Account>, std::optional<std::string>)> completion)
        override;

    void setToken(std::optional<std::string> token);

    // The answer of the next renewals: a result code, a reason, and the token stored when
    // the code is 0 (none: the stored token is removed).
    struct Renewal {
        long code = 0;
        std::optional<std::string> error;
        std::optional<std::string> token = std::string("renewed-token");
    };

    std::shared_ptr<const Account> primary;
    std::shared_ptr<const Account> kf;
    std::shared_ptr<const Account> ostara;
    std::shared_ptr<const Account> silentAccount;
    std::optional<std::string> silentError = std::string("silent authentication failed");
    Renewal renewal;

    std::vector<CredentialRenewalOptions> renewals();
    std::vector<std::string> silentReasons();
    int ostaraLookups();

  private:
    std::mutex mutex_;
    std::map<std::string, std::string> tokens_;
    std::vector<CredentialRenewalOptions> renewals_;
    std::vector<std::string> silentReasons_;
    int ostaraLookups_ = 0;
    TaskThreads threads_;
};

class FakeIdentityAccountManager : public IdentityAccountManager {
  public:
    void addClientInfoHeader(HttpRequest& request) override;
    void addDeviceUDIDHeader(HttpRequest& request) override;
    std::map<std::string, std::string> identityHeadersForRequest(
        const HttpRequest& request) override;

    std::map<std::string, std::string> extraHeaders{{"X-Fake-Identity", "identity-value"}};
};

}  // namespace qax::test
