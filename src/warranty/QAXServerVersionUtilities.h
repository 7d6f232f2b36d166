// Negotiates the coverage service's protocol versions against the agent's own pair: fetches
// the server's version list, caches it in the preference store and answers whether the
// server is supported and whether the high version's feature set is on. Stateless (all
// state is in the preference store, unlocked: the last writer wins); any thread. Fetched
// lists complete on the HTTP client's callback thread, everything else before returning.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>

#include "core/Value.h"

namespace qax {

struct Platform;

// Where the server's version list comes from. Any other value behaves as CacheFirst.
enum QAXServerLookupPolicy : std::uint64_t {
    // The valid cache; else a fetch; else the client versions.
    QAXServerLookupPolicyCacheFirst = 0,
    // The valid cache; else the client versions. Never fetches; answers before returning.
    QAXServerLookupPolicyNoNetwork = 1,
    // A fetch; else the cache as it was before the fetch; else the client versions.
    QAXServerLookupPolicyNetworkFirst = 2,
};

using QAXVersionSet = std::set<std::int64_t>;

class QAXServerVersionUtilities {
  public:
    // GETs a property-list dictionary. When the body parses to something else and
    // `shouldRetry` is set, asks once more bypassing any locally cached answer. The
    // completion runs exactly once, with none on any failure.
    static void _dictionaryFromURL(const Platform& platform, const std::optional<std::string>& url,
                                   bool shouldRetry,
                                   std::function<void(std::optional<Value>)> completion);

    // The cached server version list, or none. A cache that is not a dictionary is removed.
    static std::optional<Value> _getValidServerVersionCache(const Platform& platform);

    // The overlap of the client's and the server's version end points, or none when the
    // server's list is unusable.
    static void _supportedVersionsForClientAndServer(
        const Platform& platform, QAXServerLookupPolicy policy,
        std::function<void(std::optional<QAXVersionSet>)> completion);

    // Whether any version is shared, negotiated with the network first.
    static void serverVersionSupported(std::shared_ptr<Platform> platform,
                                       std::function<void(bool)> completion);

    // Whether the shared versions include the agent's "HighServerVersion".
    static void isHighServerVersionFeaturesetEnabled(std::shared_ptr<Platform> platform,
                                                     QAXServerLookupPolicy policy,
                                                     std::function<void(bool)> completion);
    // The same under CacheFirst.
    static void isHighServerVersionFeaturesetEnabled(std::shared_ptr<Platform> platform,
                                                     std::function<void(bool)> completion);
    // The same under NoNetwork, answered at once.
    static bool isHighServerVersionFeaturesetEnabled(const Platform& platform);

    // The stored "WebFlowURL" override, as stored, or none. Callers decide whether the build
    // may hand it out.
    static std::optional<Value> readWebURLOverride(const Platform& platform);

    // Printed form of a version set in logs: "{(2, 3)}".
    static std::string describeVersionSet(const QAXVersionSet& set);
};

}  // namespace qax
