// Accounts on the host, from accounts.plist under the platform root: PrimaryCloudAccount
// {altDSID}, KFAccount {altDSID, Tokens {service: token}, TokenServiceURL}, StoreAccount and
// SilentAuthStoreAccount {storefront, accountID}. A missing section means no such account.
// Renewal asks the token service when the file names one (POST {"altDSID", "services"},
// answer {"token"}), else mints a random token; either way the token is written back to
// the file atomically. Thread-safe; completions run on the HTTP session's thread or on a
// serial queue of the store's own, never on the caller's thread.
#pragma once

#include <memory>
#include <mutex>
#include <string>

#include "core/TaskRunner.h"
#include "platform/AccountStore.h"
#include "platform/HttpClient.h"
#include "platform/host/CachedPlistFile.h"

namespace qax {

class HostAccountStore : public AccountStore {
  public:
    // Result codes of a failed renewal.
    static constexpr long kRenewalNoAccount = -1;
    static constexpr long kRenewalTransportError = -2;
    static constexpr long kRenewalBadAnswer = -3;
    static constexpr long kRenewalNotStored = -4;
    // An answer of the token service other than 200 fails with its HTTP status as the code.

    HostAccountStore(const std::string& platformRoot, std::shared_ptr<HttpClient> http,
                     std::shared_ptr<Dispatcher> dispatcher);

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

  private:
    struct Shared;
    std::optional<Value> section(std::string_view name);

    std::shared_ptr<Shared> shared_;
    CachedPlistFile file_;
    std::shared_ptr<HttpClient> http_;
    // Where renewals and silent authentications answer (none: on the caller's thread). A
    // serial queue of its own, never the blocking pool: signers wait on that pool for these
    // very answers and may hold all of its threads.
    std::shared_ptr<TaskRunner> queue_;
};

}  // namespace qax
