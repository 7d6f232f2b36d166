#include "warranty/QAXServerVersionUtilities.h"

#include <cstdlib>
#include <utility>

#include "core/Log.h"
#include "core/OnceCallback.h"
#include "core/PlistCodec.h"
#include "platform/HttpClient.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"

namespace qax {
namespace {

constexpr const char* kServerVersionCacheKey = "ServerVersionCache";
constexpr const char* kServerVersionOverrideKey = "ServerVersionOverride";
constexpr const char* kWebFlowURLKey = "WebFlowURL";
// The version list uses the same two key names as the agent's own settings.
constexpr const char* kLowVersionKey = settings::kLowServerVersion;
constexpr const char* kHighVersionKey = settings::kHighServerVersion;

using DictionaryCompletion = std::function<void(std::optional<Value>)>;
using SetCompletion = std::function<void(std::optional<QAXVersionSet>)>;

// Fetches with only the HTTP session in hand, so that a retry does not depend on the
// caller's platform context still being around. The transfer holds the session weakly: a
// session being torn down is not kept alive by its own outstanding requests.
void fetchDictionary(std::weak_ptr<HttpClient> session, std::optional<std::string> url,
                     bool shouldRetry, DictionaryCompletion completion) {
    static constexpr const char* kFetchFailed =
        "Failed to fetch plist data from URL '%@' with error: %@";
    static constexpr const char* kParseFailed = "Error serializing plist file from URL '%@': %@";
    static constexpr const char* kRetrying = "Incorrect format in response detected. retrying...";
    static constexpr const char* kAborting =
        "Incorrect format in response detected from URL '%@'. Response: %@. Aborting without "
        "retry.";

    std::shared_ptr<HttpClient> http = session.lock();
    if (!http || !url || url->empty()) {
        qaxLog().error(kFetchFailed, url, !http ? "no HTTP session" : "no URL");
        completion(std::nullopt);
        return;
    }
    HttpRequest request(*url);
    // The second attempt must reach the server: a cached copy is what looked wrong.
    request.setIgnoresLocalCache(!shouldRetry);
    http->send(request, [session, url, shouldRetry, completion](HttpResult result) mutable {
        if (!result.response) {
            qaxLog().error(kFetchFailed, url, result.error);
            completion(std::nullopt);
            return;
        }
        std::string error;
        auto parsed = parsePlist(result.response->body, &error);
        if (!parsed) {
            qaxLog().error(kParseFailed, url, error);
            completion(std::nullopt);
            return;
        }
        if (parsed->isDictionary()) {
            completion(std::move(parsed));
            return;
        }
        if (shouldRetry) {
            qaxLog().error(kRetrying);
            fetchDictionary(std::move(session), std::move(url), false, std::move(completion));
            return;
        }
        qaxLog().error(kAborting, url, *parsed);
        completion(std::nullopt);
    });
}

// A version from the list: an integer, or the leading decimal integer of a string.
std::optional<std::int64_t> versionNumber(const Value* v) {
    if (!v) {
        return std::nullopt;
    }
    if (auto i = v->asInteger()) {
        return *i;
    }
    if (auto* s = v->asString()) {
        return std::strtoll(s->c_str(), nullptr, 10);
    }
    if (auto b = v->asBool()) {
        return *b ? 1 : 0;
    }
    return std::nullopt;
}

Value clientVersions(PreferenceStore& preferences) {
    Value list{Value::Dictionary{}};
    list[kLowVersionKey] = preferences.integerForKey(settings::kLowServerVersion);
    list[kHighVersionKey] = preferences.integerForKey(settings::kHighServerVersion);
    return list;
}

Value clientVersionsLogged(PreferenceStore& preferences) {
    Value list = clientVersions(preferences);
    qaxLog().info("Using Client version: %@", list);
    return list;
}

void storeAsCache(PreferenceStore& preferences, const Value& list) {
    preferences.setObject(kServerVersionCacheKey, list);
    qaxLog().info("Caching Server version  %@", list);
}

// The overlap of the two pairs' end points, given the server's list.
void overlap(PreferenceStore& preferences, const std::optional<Value>& serverList,
             const SetCompletion& completion) {
    static constexpr const char* kMissingKey = "Server version dictionary missing key '%@'";
    qaxLog().info("Server version  %@", serverList);
    if (!serverList) {
        qaxLog().error("No server version dictionary found");
        completion(std::nullopt);
        return;
    }
    if (!serverList->isDictionary()) {
        qaxLog().error("Incorrect serverDictionary format");
        completion(std::nullopt);
        return;
    }
    auto low = versionNumber(serverList->find(kLowVersionKey));
    if (!low) {
        qaxLog().error(kMissingKey, kLowVersionKey);
        completion(std::nullopt);
        return;
    }
    auto high = versionNumber(serverList->find(kHighVersionKey));
    if (!high) {
        qaxLog().error(kMissingKey, kHighVersionKey);
        completion(std::nullopt);
        return;
    }
    const QAXVersionSet server{*low, *high};
    qaxLog().info("Server versions '%@'", QAXServerVersionUtilities::describeVersionSet(server));
    const QAXVersionSet client{preferences.integerForKey(settings::kLowServerVersion),
                               preferences.integerForKey(settings::kHighServerVersion)};
    qaxLog().info("Client versions '%@'", QAXServerVersionUtilities::describeVersionSet(client));
    QAXVersionSet both;
    for (std::int64_t v : client) {
        if (server.contains(v)) {
            both.insert(v);
        }
    }
    qaxLog().info("clientAndServerSet '%@'", QAXServerVersionUtilities::describeVersionSet(both));
    completion(std::move(both));
}

// Whether the shared versions hold the agent's high version; logs the answer.
bool highVersionShared(PreferenceStore& preferences, const std::optional<QAXVersionSet>& versions) {
    const std::int64_t high = preferences.integerForKey(settings::kHighServerVersion);
    const bool enabled = versions && !versions->empty() && versions->contains(high);
    qaxLog().info("High Server version supported - %@", enabled ? "YES" : "NO");
    return enabled;
}

}  // namespace

void QAXServerVersionUtilities::_dictionaryFromURL(const Platform& platform,
                                                   const std::optional<std::string>& url,
                                                   bool shouldRetry,
                                                   DictionaryCompletion completion) {
    fetchDictionary(platform.http, url, shouldRetry,
                    onceCallback(std::move(completion), "_dictionaryFromURL completion"));
}

std::optional<Value> QAXServerVersionUtilities::_getValidServerVersionCache(
    const Platform& platform) {
    auto cache = platform.preferences->objectForKey(kServerVersionCacheKey);
    if (cache && !cache->isDictionary()) {
        qaxLog().error("Incorrect format stored in server version cache. Removing it.");
        platform.preferences->removeObject(kServerVersionCacheKey);
        return std::nullopt;
    }
    return cache;
}

void QAXServerVersionUtilities::_supportedVersionsForClientAndServer(const Platform& platform,
                                                                     QAXServerLookupPolicy policy,
                                                                     SetCompletion completion) {
    completion = onceCallback(std::move(completion), "_supportedVersionsForClientAndServer");
    std::shared_ptr<PreferenceStore> preferences = platform.preferences;

    auto overridden = preferences->objectForKey(kServerVersionOverrideKey);
    qaxLog().info(" Server lookup policy:%ld", static_cast<std::uint64_t>(policy));
    if (overridden) {
        qaxLog().info("Using Overridden Server version  %@", *overridden);
        preferences->setObject(kServerVersionCacheKey, *overridden);
        overlap(*preferences, overridden, completion);
        return;
    }

    auto cache = _getValidServerVersionCache(platform);
    std::optional<std::string> url;
    if (auto stored = preferences->objectForKey(settings::kServerVersionURL)) {
        if (auto* s = stored->asString()) {
            url = *s;
        }
    }

    switch (policy) {
        case QAXServerLookupPolicyNoNetwork: {
            if (cache) {
                qaxLog().info("Using Cached Server version: %@", *cache);
                overlap(*preferences, cache, completion);
            } else {
                overlap(*preferences, clientVersionsLogged(*preferences), completion);
            }
            return;
        }
        case QAXServerLookupPolicyNetworkFirst: {
            fetchDictionary(platform.http, url, true,
                            [preferences, cache, completion](std::optional<Value> fetched) {
                                Value chosen = fetched ? std::move(*fetched)
                                               : cache ? *cache
                                                       : clientVersionsLogged(*preferences);
                                storeAsCache(*preferences, chosen);
                                overlap(*preferences, chosen, completion);
                            });
            return;
        }
        case QAXServerLookupPolicyCacheFirst:
        default: {
            if (cache) {
                overlap(*preferences, cache, completion);
                return;
            }
            fetchDictionary(
                platform.http, url, true, [preferences, completion](std::optional<Value> fetched) {
                    if (fetched) {
                        storeAsCache(*preferences, *fetched);
                        overlap(*preferences, fetched, completion);
                    } else {
                        overlap(*preferences, clientVersionsLogged(*preferences), completion);
                    }
                });
            return;
        }
    }
}

void QAXServerVersionUtilities::serverVersionSupported(std::shared_ptr<Platform> platform,
                                                       std::function<void(bool)> completion) {
    completion = onceCallback(std::move(completion), "serverVersionSupported");
    _supportedVersionsForClientAndServer(
        *platform, QAXServerLookupPolicyNetworkFirst,
        [completion](std::optional<QAXVersionSet> versions) {
            const bool supported = versions && !versions->empty();
            if (supported) {
                qaxLog().info("Server version supported by client version - '%@'",
                              describeVersionSet(*versions));
            }
            completion(supported);
        });
}

void QAXServerVersionUtilities::isHighServerVersionFeaturesetEnabled(
    std::shared_ptr<Platform> platform, QAXServerLookupPolicy policy,
    std::function<void(bool)> completion) {
    completion = onceCallback(std::move(completion), "isHighServerVersionFeaturesetEnabled");
    std::shared_ptr<PreferenceStore> preferences = platform->preferences;
    _supportedVersionsForClientAndServer(
        *platform, policy, [preferences, completion](std::optional<QAXVersionSet> versions) {
            completion(highVersionShared(*preferences, versions));
        });
}

void QAXServerVersionUtilities::isHighServerVersionFeaturesetEnabled(
    std::shared_ptr<Platform> platform, std::function<void(bool)> completion) {
    isHighServerVersionFeaturesetEnabled(std::move(platform), QAXServerLookupPolicyCacheFirst,
                                         std::move(completion));
}

bool QAXServerVersionUtilities::isHighServerVersionFeaturesetEnabled(const Platform& platform) {
    // NoNetwork answers before it returns, so the answer is in hand when the call is over.
    std::shared_ptr<PreferenceStore> preferences = platform.preferences;
    bool enabled = false;
    _supportedVersionsForClientAndServer(
        platform, QAXServerLookupPolicyNoNetwork,
        [&enabled, preferences](std::optional<QAXVersionSet> versions) {
            enabled = highVersionShared(*preferences, versions);
        });
    return enabled;
}

std::optional<Value> QAXServerVersionUtilities::readWebURLOverride(const Platform& platform) {
    static constexpr const char* kOperation = "+[QAXServerVersionUtilities readWebURLOverride]";
    qaxLog().info("%s", kOperation);
    return platform.preferences->objectForKey(kWebFlowURLKey);
}

std::string QAXServerVersionUtilities::describeVersionSet(const QAXVersionSet& set) {
    std::string out = "{(";
    for (auto it = set.begin(); it != set.end(); ++it) {
        if (it != set.begin()) {
            out += ", ";
        }
        out += std::to_string(*it);
    }
    return out + ")}";
}

}  // namespace qax
