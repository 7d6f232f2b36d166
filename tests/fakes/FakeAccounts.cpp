#include "fakes/FakeAccounts.h"

#include "platform/HttpClient.h"

namespace qax::test {

void TaskThreads::run(std::function<void()> task) {
    std::lock_guard lock(mutex_);
    threads_.emplace_back(std::move(task));
}

void TaskThreads::drain() {
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

FakeAccountStore::FakeAccountStore() {
    primary = std::make_shared<Account>(Account{"primary-altdsid", std::nullopt, std::nullopt});
    kf = std::make_shared<Account>(Account{"kf-altdsid", std::nullopt, std::nullopt});
    ostara = std::make_shared<Account>(Account{std::nullopt, "143441-1,29", 12345});
    tokens_[kKFService] = "stored-token";
}

std::shared_ptr<const Account> FakeAccountStore::primaryCloudAccount() {
    return primary;
}

std::shared_ptr<const Account> FakeAccountStore::kfAccountForCloudAccount(const Account&) {
    return kf;
}

std::optional<std::string> FakeAccountStore::credentialTokenForAccount(const Account&,
                                                                       const std::string& service) {
    std::lock_guard lock(mutex_);
    auto it = tokens_.find(service);
    return it == tokens_.end() ? std::nullopt : std::optional<std::string>(it->second);
}

void FakeAccountStore::setToken(std::optional<std::string> token) {
    std::lock_guard lock(mutex_);
    if (token) {
        tokens_[kKFService] = *token;
    } else {
        tokens_.erase(kKFService);
    }
}

void FakeAccountStore::renewCredentialsForAccount(
    const Account&, const CredentialRenewalOptions& options,
    std::function<void(long, std::optional<std::string>)> completion) {
    Renewal answer;
    {
        std::lock_guard lock(mutex_);
        renewals_.push_back(options);
        answer = renewal;
    }
    threads_.run([this, answer, services = options.services, completion = std::move(completion)] {
        if (answer.code == 0) {
            for (const auto& service : services) {
                std::lock_guard lock(mutex_);
                if (answer.token) {
                    tokens_[service] = *answer.token;
                } else {
                    tokens_.erase(service);
                }
            }
        }
        completion(answer.code, answer.error);
    });
}

std::shared_ptr<const Account> FakeAccountStore::ostaraAccountForCloudAccount(const Account&) {
    std::lock_guard lock(mutex_);
    ++ostaraLookups_;
    return ostara;
}

void FakeAccountStore::authenticateSilently(
    const Account&, const std::string& debugReason,
    std::function<void(std::shared_ptr<const Account>, std::optional<std::string>)> completion) {
    {
        std::lock_guard lock(mutex_);
        silentReasons_.push_back(debugReason);
    }
    auto account = silentAccount;
    auto error = account ? std::nullopt : silentError;
    threads_.run(
        [account, error, completion = std::move(completion)] { completion(account, error); });
}

std::vector<CredentialRenewalOptions> FakeAccountStore::renewals() {
    std::lock_guard lock(mutex_);
    return renewals_;
}

std::vector<std::string> FakeAccountStore::silentReasons() {
    std::lock_guard lock(mutex_);
    return silentReasons_;
}

int FakeAccountStore::ostaraLookups() {
    std::lock_guard lock(mutex_);
    return ostaraLookups_;
}

void FakeIdentityAccountManager::addClientInfoHeader(HttpRequest& request) {
    request.setValue("X-Fake-Client-Info", std::string("client-info"));
}

void FakeIdentityAccountManager::addDeviceUDIDHeader(HttpRequest& request) {
    request.setValue("X-Fake-UDID", std::string("device-udid"));
}

std::map<std::string, std::string> FakeIdentityAccountManager::identityHeadersForRequest(
    const HttpRequest&) {
    return extraHeaders;
}

}  // namespace qax::test
