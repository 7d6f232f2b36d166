// The platform's account store: the primary cloud account, the KF account that holds
// per-service credential tokens, their renewal, and the media-store account of a cloud
// account. Implementations are thread-safe; completions run on a platform thread, never
// on the caller's, so a caller may block its own thread waiting for one.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace qax {

// One account as the store describes it. Which properties are set depends on the kind of
// account: cloud and KF accounts carry an altDSID, store accounts a storefront and an
// account number. Immutable once handed out.
struct Account {
    std::optional<std::string> altDSID;
    std::optional<std::string> storefront;
    std::optional<std::int64_t> storeAccountID;
};

struct CredentialRenewalOptions {
    // The renewal may not show any user interface.
    bool avoidUserInterface = false;
    // Identifiers of the services whose tokens are renewed.
    std::vector<std::string> services;
};

class AccountStore {
  public:
    virtual ~AccountStore() = default;

    // The user's primary cloud account; none when nobody is signed in.
    virtual std::shared_ptr<const Account> primaryCloudAccount() = 0;
    // The KF account paired with a cloud account; none when there is none.
    virtual std::shared_ptr<const Account> kfAccountForCloudAccount(
        const Account& cloudAccount) = 0;
    // The stored token of `service` on a KF account; none when nothing is stored.
    virtual std::optional<std::string> credentialTokenForAccount(const Account& kfAccount,
                                                                 const std::string& service) = 0;
    // Renews the tokens of the listed services. `completion` runs exactly once with result
    // code 0 and no error on success, a non-zero code and a reason otherwise.
    virtual void renewCredentialsForAccount(
        const Account& kfAccount, const CredentialRenewalOptions& options,
        std::function<void(long resultCode, std::optional<std::string> error)> completion) = 0;
    // The media-store account of a cloud account, as far as the store already knows it.
    virtual std::shared_ptr<const Account> ostaraAccountForCloudAccount(
        const Account& cloudAccount) = 0;
    // Asks the store service for the media-store account without any user interface.
    // `completion` runs exactly once with an account, or with none and a reason.
    virtual void authenticateSilently(const Account& cloudAccount, const std::string& debugReason,
                                      std::function<void(std::shared_ptr<const Account> account,
                                                         std::optional<std::string> error)>
                                          completion) = 0;
};

}  // namespace qax
