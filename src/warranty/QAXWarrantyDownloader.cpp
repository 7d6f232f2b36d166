#include "warranty/QAXWarrantyDownloader.h"

#include <cctype>
#include <filesystem>
#include <utility>

#include "core/AtomicFile.h"
#include "core/Hash.h"
#include "core/JsonCodec.h"
#include "core/Log.h"
#include "core/OnceCallback.h"
#include "core/PlistCodec.h"
#include "devices/QAXDevicesManager.h"
#include "platform/AgentFactory.h"
#include "platform/HttpClient.h"
#include "platform/LocaleInfo.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"
#include "signing/AccountHeaders.h"
#include "warranty/QAXServerVersionUtilities.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

constexpr std::int32_t kRetries = 2;
constexpr double kRequestTimeoutSeconds = 30;
constexpr const char* kCacheVersion = "2";
constexpr long kStatusOK = 200;
constexpr long kStatusUnauthorized = 401;
// A summary is a few kilobytes. A far larger answer would become a cache entry too large to
// be sent to any client (an IPC reply carries every device in at most 4 MiB), so it is
// refused like one that does not parse, and the cache keeps what it had.
constexpr std::size_t kMaxSummaryBytes = 1024 * 1024;

constexpr const char* kServerVersionCacheKey = "ServerVersionCache";
constexpr const char* kConversionOutreachScheduledDateKey = "ConversionOutreachScheduledDate";
constexpr const char* kLastUpdatedDateKeySuffix = "_CachedWarrantyLastUpdatedDate";
constexpr const char* kLocaleKeySuffix = "_CachedWarrantyLocale";
constexpr const char* kVersionKeySuffix = "_CachedWarrantyVersion";

// The serial number of the device the agent runs on. The devices manager keeps nothing
// between calls, so one made on this download's platform answers as the shared one does.
std::optional<std::string> defaultDeviceSerialNumber(const std::shared_ptr<Platform>& platform) {
    auto device = QAXDevicesManager(platform).defaultDevice();
    return device ? device->serialNumber() : std::nullopt;
}

bool isDefaultDevice(const std::optional<std::string>& defaultSerial,
                     const std::string& serialNumber) {
    return defaultSerial && *defaultSerial == serialNumber;
}

bool isFileURL(const std::string& url) {
    if (url.size() < 5) {
        return false;
    }
    std::string scheme = url.substr(0, 5);
    for (auto& c : scheme) {
        c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    }
    return scheme == "file:";
}

int hexValue(char c) {
    if (c >= '0' && c <= '9') {
        return c - '0';
    }
    c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return c >= 'a' && c <= 'f' ? c - 'a' + 10 : -1;
}

// The local path of a file URL ("file:///dir/w.plist", "file:/dir/w.plist",
// "file://localhost/dir/w.plist"), percent escapes decoded; none for another host.
std::optional<std::string> pathOfFileURL(const std::string& url) {
    std::string rest = url.substr(5);
    if (rest.rfind("//", 0) == 0) {
        rest = rest.substr(2);
        const auto slash = rest.find('/');
        const std::string host = rest.substr(0, slash);
        if (!host.empty() && host != "localhost") {
            return std::nullopt;
        }
        rest = slash == std::string::npos ? std::string() : rest.substr(slash);
    }
    std::string path;
    for (std::size_t i = 0; i < rest.size(); ++i) {
        if (rest[i] == '%' && i + 2 < rest.size() && hexValue(rest[i + 1]) >= 0 &&
            hexValue(rest[i + 2]) >= 0) {
            path += static_cast<char>(hexValue(rest[i + 1]) * 16 + hexValue(rest[i + 2]));
            i += 2;
        } else {
            path += rest[i];
        }
    }
    if (path.empty() || path.find('\0') != std::string::npos) {
        return std::nullopt;
    }
    return path;
}

// "dir/w.plist" becomes "dir/w.SERIAL.plist". A serial number that would leave the file's
// directory (or cannot be part of a file name) has no file of its own.
std::optional<std::string> perSerialURL(const std::string& url, const std::string& serialNumber) {
    if (serialNumber.empty() ||
        serialNumber.find_first_of(std::string("/\0", 2)) != std::string::npos) {
        return std::nullopt;
    }
    const auto slash = url.rfind('/');
    const auto dot = url.rfind('.');
    if (dot == std::string::npos || (slash != std::string::npos && dot < slash)) {
        return url + "." + serialNumber;
    }
    return url.substr(0, dot) + "." + serialNumber + url.substr(dot);
}

std::optional<std::string> readFileURL(const std::optional<std::string>& url) {
    if (!url) {
        return std::nullopt;
    }
    auto path = pathOfFileURL(*url);
    if (!path) {
        return std::nullopt;
    }
    std::error_code ec;
    if (!std::filesystem::is_regular_file(*path, ec)) {
        return std::nullopt;
    }
    return readWholeFile(*path, kMaxPlistBytes);
}

}  // namespace

std::shared_ptr<QAXWarrantyDownloader> QAXWarrantyDownloader::initWithCallingProcessBundleID(
    std::shared_ptr<Platform> platform, std::string callingProcessBundleID) {
    return std::make_shared<QAXWarrantyDownloader>(std::move(platform),
                                                   std::move(callingProcessBundleID));
}

QAXWarrantyDownloader::QAXWarrantyDownloader(std::shared_ptr<Platform> platform,
                                             std::string callingProcessBundleID)
    : platform_(std::move(platform)), callingProcessBundleID_(std::move(callingProcessBundleID)) {
    qaxLog().debug("%s: callingProcess=%@",
                   "-[QAXWarrantyDownloader initWithCallingProcessBundleID:]",
                   callingProcessBundleID_);
}

void QAXWarrantyDownloader::downloadWarrantyForSerialNumber(const std::string& serialNumber,
                                                            Completion completion) {
    qaxLog().info("%s: %{private}@",
                  "-[QAXWarrantyDownloader downloadWarrantyForSerialNumber:completionHandler:]",
                  serialNumber);
    completion = onceCallback(std::move(completion), "downloadWarrantyForSerialNumber");
    // The negotiation below always fetches the list; with the cache gone, a failed fetch falls
    // back to the client's own versions, never to a list an earlier download cached.
    platform_->preferences->removeObject(kServerVersionCacheKey);
    auto self = shared_from_this();
    QAXServerVersionUtilities::serverVersionSupported(
        platform_, [self, serialNumber, completion](bool supported) {
            if (!supported) {
                qaxLog().info("Warranty download skipped server due to server version");
                completion(false, nullptr);
                return;
            }
            self->_downloadWarrantyForSerialNumber(serialNumber, completion);
        });
}

void QAXWarrantyDownloader::_downloadWarrantyForSerialNumber(const std::string& serialNumber,
                                                             Completion completion) {
    const bool forThisDevice = isDefaultDevice(defaultDeviceSerialNumber(platform_), serialNumber);
    const char* urlKey = forThisDevice ? settings::kWarrantyURL : settings::kWearablesWarrantyURL;
    const std::string url = platform_->preferences->stringForKey(urlKey).value_or("");

    auto self = shared_from_this();
    // Results are handled on the background queue, whichever source they came from.
    auto handle = [self, serialNumber, completion](std::optional<Value> dictionary) {
        self->platform_->dispatcher->backgroundQueue()->post(
            [self, serialNumber, completion, dictionary = std::move(dictionary)]() {
                self->handleDownloadedDictionary(serialNumber, dictionary, completion);
            });
    };
    if (isFileURL(url)) {
        handle(dictionaryFromURL(url, serialNumber));
        return;
    }
    _downloadWarrantyFromServerURL(url, serialNumber, kRetries, std::move(handle));
}

void QAXWarrantyDownloader::handleDownloadedDictionary(const std::string& serialNumber,
                                                       const std::optional<Value>& dictionary,
                                                       const Completion& completion) {
    // The record is built from an object; any other document fails like one that did not
    // parse, and leaves the cache as it was.
    if (!dictionary || !dictionary->isDictionary()) {
        qaxLog().error("qaxagent failed to load warranty");
        completion(false, nullptr);
        return;
    }
    qaxLog().info("downloaded warranty: %@", *dictionary);
    auto warranty = QAXWarranty::warrantyWithDictionary(platform_, dictionary, serialNumber);
    // Read before anything is overwritten: the conversion rule compares with it.
    auto cached = QAXWarranty::cachedWarrantyForSerialNumber(platform_, serialNumber);
    _scheduleConversionOutreachIfRequiredForWarranty(warranty, cached);

    const std::string locale = platform_->locale->preferredLocaleIdentifier();
    qaxLog().info("caching warranty for locale: '%@', version: %@", locale, kCacheVersion);
    if (!warranty->cacheWarranty(serialNumber)) {
        // The keys describe the file on disk: stamping them over the previous file would make
        // that older summary look freshly downloaded for this locale.
        completion(true, std::move(warranty));
        return;
    }

    PreferenceStore& preferences = *platform_->preferences;
    const std::string hash = sha256Hash(serialNumber);
    preferences.setObject(hash + kLastUpdatedDateKeySuffix, Value(platform_->clock->now()));
    preferences.setObject(hash + kLocaleKeySuffix, Value(locale));
    preferences.setObject(hash + kVersionKeySuffix, Value(kCacheVersion));
    completion(true, std::move(warranty));
}

void QAXWarrantyDownloader::_downloadWarrantyFromServerURL(
    const std::string& url, const std::string& serialNumber, std::int32_t retries,
    std::function<void(std::optional<Value>)> completionBlock) {
    auto self = shared_from_this();
    // Signing renews credentials and waits for attestation: it runs where blocking is allowed,
    // never on the background queue or a connection's queue.
    platform_->dispatcher->blockingQueue()->post(
        [self, url, serialNumber, retries, completionBlock = std::move(completionBlock)]() {
            self->sendAttempt(url, serialNumber, retries, completionBlock);
        });
}

void QAXWarrantyDownloader::sendAttempt(const std::string& url, const std::string& serialNumber,
                                        std::int32_t retries,
                                        std::function<void(std::optional<Value>)> completionBlock) {
    qaxLog().info("%{private}@ : warranty download attempt (%d/%d)", serialNumber,
                  kRetries - retries, kRetries);
    HttpRequest request(url, kRequestTimeoutSeconds);
    // Every attempt after the first gets a freshly provisioned account token: a 401 most
    // likely means the stored one is stale.
    const bool forceReprovisioning = retries != kRetries;
    if (!qax_signWithAccountHeaders(request, *platform_, forceReprovisioning, true,
                                    callingProcessBundleID_)) {
        qaxLog().info("Unable to load sign request, failing warranty download");
        completionBlock(std::nullopt);
        return;
    }
    qaxLog().info("Retrying request:");
    // The host's HTTP session has no per-process traffic attribution; the user agent already
    // names the calling process.
    qax_setCoverageRequestBodyWithSerialNumber(request, *platform_, serialNumber);
    if (isDefaultDevice(defaultDeviceSerialNumber(platform_), serialNumber)) {
        addKVAAuthenticationHeadersWithBody(request, *platform_, request.body().value_or(""));
    }
    // The headers carry account tokens and the body the serial number: both are private.
    qaxLog().info("Headers: %{private}@", headerDescription(request));
    qaxLog().info("Body: %{private}@", bodyDescription(request));

    std::shared_ptr<HttpClient> http = platform_->http;
    if (!http) {
        qaxLog().info("load warranty status: %ld : %@", 0L, "no HTTP session");
        completionBlock(std::nullopt);
        return;
    }
    auto self = shared_from_this();
    http->send(
        request, [self, url, serialNumber, retries, completionBlock](HttpResult result) mutable {
            const long status = result.response ? result.response->statusCode : 0;
            std::optional<Value> parsed;
            if (result.response && result.response->body.size() > kMaxSummaryBytes) {
                qaxLog().error("Ignoring a coverage answer of %lu bytes (at most %lu)",
                               result.response->body.size(), kMaxSummaryBytes);
            } else if (result.response && !result.response->body.empty()) {
                parsed = parseJson(result.response->body);
            }
            if (parsed) {
                qaxLog().info("load warranty status: %ld : %@", status, *parsed);
            } else {
                qaxLog().info("load warranty status: %ld : %@", status,
                              result.error.empty() ? std::optional<std::string>() : result.error);
            }
            if (status == kStatusUnauthorized) {
                if (retries >= 1) {
                    self->_downloadWarrantyFromServerURL(url, serialNumber, retries - 1,
                                                         std::move(completionBlock));
                } else {
                    completionBlock(std::nullopt);
                }
                return;
            }
            completionBlock(status == kStatusOK ? std::move(parsed) : std::nullopt);
        });
}

std::optional<Value> QAXWarrantyDownloader::dictionaryFromURL(const std::string& fileURL,
                                                              const std::string& serialNumber) {
    const auto serialURL = perSerialURL(fileURL, serialNumber);
    std::optional<std::string> data = readFileURL(serialURL);
    if (data) {
        // The per-serial file is named with the serial number in clear.
        qaxLog().info("loading warranty from: %{private}@", *serialURL);
    } else {
        qaxLog().info("loading warranty from: %@", fileURL);
        data = readFileURL(fileURL);
        if (!data) {
            qaxLog().error("URL '%@' contains no plist data", fileURL);
            return std::nullopt;
        }
    }
    std::string error;
    auto parsed = parsePlist(*data, &error);
    if (!parsed) {
        qaxLog().error("Error serializing plist file from URL '%@': %@", fileURL, error);
        return std::nullopt;
    }
    return parsed;
}

void QAXWarrantyDownloader::_scheduleConversionOutreachIfRequiredForWarranty(
    const std::shared_ptr<QAXWarranty>& warranty,
    const std::shared_ptr<QAXWarranty>& cachedWarranty) {
    if (cachedWarranty && warranty) {
        const auto before = cachedWarranty->hvOfferConversionDate();
        const auto now = warranty->hvOfferConversionDate();
        if (!before || !now || *before == *now) {
            return;
        }
    } else if (!warranty) {
        return;
    }
    const std::optional<Date> date = warranty->hvOfferConversionDate();
    if (!date) {
        return;
    }
    PreferenceStore& preferences = *platform_->preferences;
    if (auto scheduled = preferences.dateForKey(kConversionOutreachScheduledDateKey)) {
        // Only an earlier conversion date moves the outreach; a later one waits for the
        // outreach already scheduled.
        if (!(*date < *scheduled)) {
            return;
        }
        qaxLog().info("Re-scheduling conversion outreach %@", *date);
    } else {
        qaxLog().info("scheduling conversion outreach %@", *date);
    }
    if (platform_->agentFactory) {
        platform_->agentFactory->scheduleActivityForDate(kQAXConversionOutreachActivityIdentifier,
                                                         *date);
    } else {
        qaxLog().error("no activity scheduling in this process; conversion outreach not scheduled");
    }
    preferences.setObject(kConversionOutreachScheduledDateKey, Value(*date));
}

}  // namespace qax
