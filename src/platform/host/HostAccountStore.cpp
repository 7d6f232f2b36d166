#include "platform/host/HostAccountStore.h"

#include <fcntl.h>
#include <openssl/rand.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>

#include "core/AtomicFile.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

constexpr const char* kPrimaryCloudAccount = "PrimaryCloudAccount";
constexpr const char* kKFAccount = "KFAccount";
constexpr const char* kStoreAccount = "StoreAccount";
constexpr const char* kSilentAuthStoreAccount = "SilentAuthStoreAccount";
constexpr const char* kAltDSID = "altDSID";
constexpr const char* kStorefront = "storefront";
constexpr const char* kAccountID = "accountID";
constexpr const char* kTokens = "Tokens";
constexpr const char* kTokenServiceURL = "TokenServiceURL";
constexpr double kTokenServiceTimeoutSeconds = 30;

std::optional<std::string> stringAt(const Value& dictionary, std::string_view key) {
    const Value* v = dictionary.find(key);
    const std::string* s = v ? v->asString() : nullptr;
    return s ? std::optional<std::string>(*s) : std::nullopt;
}

std::shared_ptr<const Account> accountFromSection(const std::optional<Value>& section) {
    if (!section) {
        return nullptr;
    }
    auto account = std::make_shared<Account>();
    account->altDSID = stringAt(*section, kAltDSID);
    account->storefront = stringAt(*section, kStorefront);
    if (const Value* id = section->find(kAccountID)) {
        account->storeAccountID = id->asInteger();
    }
    return account;
}

std::string mintToken() {
    unsigned char bytes[32];
    if (RAND_bytes(bytes, sizeof bytes) != 1) {
        return std::string();
    }
    static const char* hex = "0123456789abcdef";
    std::string out;
    for (unsigned char b : bytes) {
        out += hex[b >> 4];
        out += hex[b & 15];
    }
    return out;
}

}  // namespace

// What a renewal's completion needs after the store itself may be gone: the file and the
// lock that serialises its rewrites.
struct HostAccountStore::Shared {
    std::string path;
    std::string lockPath;
    std::mutex mutex;

    // Writes `token` for every service into KFAccount.Tokens, re-reading the file first so
    // that edits made since it was last read are kept.
    bool storeToken(const std::vector<std::string>& services, const std::string& token,
                    std::string* error) {
        std::lock_guard lock(mutex);
        std::error_code ec;
        fs::create_directories(fs::path(lockPath).parent_path(), ec);
        int fd = ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
        if (fd >= 0) {
            while (::flock(fd, LOCK_EX) != 0 && errno == EINTR) {
            }
        }
        bool ok = false;
        auto bytes = readWholeFile(path, kMaxPlistBytes);
        std::optional<Value> root = bytes ? parsePlist(*bytes) : std::nullopt;
        Value::Dictionary* top = root ? root->asDictionary() : nullptr;
        auto kf = top ? top->find(kKFAccount) : Value::Dictionary::iterator();
        if (!top || kf == top->end() || !kf->second.isDictionary()) {
            *error = "accounts.plist has no KF account";
        } else {
            Value& tokens = kf->second[kTokens];
            for (const auto& service : services) {
                tokens[service] = Value(token);
            }
            auto xml = toXmlPlist(*root);
            if (!xml) {
                *error = "accounts.plist cannot be written as a property list";
            } else {
                ok = writeFileAtomically(path, *xml, error, 0600);
            }
        }
        if (fd >= 0) {
            ::close(fd);
        }
        return ok;
    }
};

HostAccountStore::HostAccountStore(const std::string& platformRoot,
                                   std::shared_ptr<HttpClient> http,
                                   std::shared_ptr<Dispatcher> dispatcher)
    : shared_(std::make_shared<Shared>()),
      file_((fs::path(platformRoot) / "accounts.plist").string()),
      http_(std::move(http)),
      queue_(dispatcher ? dispatcher->makeSerialQueue("account-store") : nullptr) {
    shared_->path = file_.path();
    shared_->lockPath = (fs::path(platformRoot) / "state" / ".accounts.lock").string();
}

std::optional<Value> HostAccountStore::section(std::string_view name) {
    auto root = file_.read();
    const Value* v = root ? root->find(name) : nullptr;
    return v && v->isDictionary() ? std::optional<Value>(*v) : std::nullopt;
}

std::shared_ptr<const Account> HostAccountStore::primaryCloudAccount() {
    return accountFromSection(section(kPrimaryCloudAccount));
}

std::shared_ptr<const Account> HostAccountStore::kfAccountForCloudAccount(const Account&) {
    return accountFromSection(section(kKFAccount));
}

std::optional<std::string> HostAccountStore::credentialTokenForAccount(const Account&,
                                                                       const std::string& service) {
    auto kf = section(kKFAccount);
    const Value* tokens = kf ? kf->find(kTokens) : nullptr;
    return tokens ? stringAt(*tokens, service) : std::nullopt;
}

void HostAccountStore::renewCredentialsForAccount(
    const Account& kfAccount, const CredentialRenewalOptions& options,
    std::function<void(long, std::optional<std::string>)> completion) {
    auto kf = section(kKFAccount);
    auto serviceURL = kf ? stringAt(*kf, kTokenServiceURL) : std::nullopt;
    auto shared = shared_;
    auto services = options.services;

    if (kf && serviceURL && http_) {
        HttpRequest request(*serviceURL, kTokenServiceTimeoutSeconds);
        request.setMethod("POST");
        request.setValue("Content-Type", std::string("application/json"));
        Value::Array serviceList(services.begin(), services.end());
        request.setBody(toJsonString(Value(Value::Dictionary{
            {kAltDSID, kfAccount.altDSID ? Value(*kfAccount.altDSID) : Value(std::string())},
            {"services", Value(std::move(serviceList))},
        })));
        http_->send(
            request, [shared, services, completion = std::move(completion)](HttpResult result) {
                if (!result.response) {
                    return completion(kRenewalTransportError,
                                      "token service unreachable: " + result.error);
                }
                if (result.response->statusCode != 200) {
                    return completion(result.response->statusCode,
                                      "token service answered HTTP " +
                                          std::to_string(result.response->statusCode));
                }
                auto answer = parseJson(result.response->body);
                const Value* token = answer ? answer->find("token") : nullptr;
                if (!token || !token->asString() || token->asString()->empty()) {
                    return completion(kRenewalBadAnswer, "token service answer holds no token");
                }
                std::string error;
                if (!shared->storeToken(services, *token->asString(), &error)) {
                    return completion(kRenewalNotStored, error);
                }
                completion(0, std::nullopt);
            });
        return;
    }

    auto renew = [kfPresent = kf.has_value(), shared, services,
                  completion = std::move(completion)] {
        if (!kfPresent) {
            return completion(kRenewalNoAccount, "no KF account");
        }
        const std::string token = mintToken();
        std::string error;
        if (token.empty()) {
            return completion(kRenewalNotStored, "no random bytes for a token");
        }
        if (!shared->storeToken(services, token, &error)) {
            return completion(kRenewalNotStored, error);
        }
        completion(0, std::nullopt);
    };
    if (queue_) {
        queue_->post(std::move(renew));
    } else {
        renew();
    }
}

std::shared_ptr<const Account> HostAccountStore::ostaraAccountForCloudAccount(const Account&) {
    return accountFromSection(section(kStoreAccount));
}

void HostAccountStore::authenticateSilently(
    const Account&, const std::string&,
    std::function<void(std::shared_ptr<const Account>, std::optional<std::string>)> completion) {
    auto account = accountFromSection(section(kSilentAuthStoreAccount));
    auto answer = [account, completion = std::move(completion)] {
        if (account) {
            completion(account, std::nullopt);
        } else {
            completion(nullptr, std::string("no store account can be authenticated silently"));
        }
    };
    if (queue_) {
        queue_->post(std::move(answer));
    } else {
        answer();
    }
}

}  // namespace qax
