// Fetches the coverage summary of one serial number (from the coverage service with signed
// requests and up to three attempts, or from a local property-list file), turns it into a
// warranty record, caches it with its date, locale and version, schedules the conversion
// outreach when the offer's conversion date moved earlier, and reports the result. One
// downloader per download, held by shared pointer until its completion has run. Signing runs on
// the dispatcher's blocking threads, requests on the HTTP session, result handling on the
// background queue; nothing waits on the network.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "core/Value.h"

namespace qax {

struct Platform;
class QAXWarranty;

class QAXWarrantyDownloader : public std::enable_shared_from_this<QAXWarrantyDownloader> {
  public:
    using Completion = std::function<void(bool success, std::shared_ptr<QAXWarranty> warranty)>;

    static std::shared_ptr<QAXWarrantyDownloader> initWithCallingProcessBundleID(
        std::shared_ptr<Platform> platform, std::string callingProcessBundleID);
    QAXWarrantyDownloader(std::shared_ptr<Platform> platform, std::string callingProcessBundleID);

    const std::string& callingProcessBundleID() const { return callingProcessBundleID_; }

    // The completion is called exactly once, on another thread except when the download is
    // skipped under a version-list override.
    void downloadWarrantyForSerialNumber(const std::string& serialNumber, Completion completion);

    void _downloadWarrantyForSerialNumber(const std::string& serialNumber, Completion completion);
    void _downloadWarrantyFromServerURL(const std::string& url, const std::string& serialNumber,
                                        std::int32_t retries,
                                        std::function<void(std::optional<Value>)> completionBlock);
    // The local-file source: the per-serial file beside `fileURL` first, then `fileURL` itself.
    std::optional<Value> dictionaryFromURL(const std::string& fileURL,
                                           const std::string& serialNumber);
    void _scheduleConversionOutreachIfRequiredForWarranty(
        const std::shared_ptr<QAXWarranty>& warranty,
        const std::shared_ptr<QAXWarranty>& cachedWarranty);

  private:
    // One attempt, on a blocking thread: sign, set the body, attest, send.
    void sendAttempt(const std::string& url, const std::string& serialNumber, std::int32_t retries,
                     std::function<void(std::optional<Value>)> completionBlock);
    // On the background queue: the record, the conversion rule, the cache and its keys.
    void handleDownloadedDictionary(const std::string& serialNumber,
                                    const std::optional<Value>& dictionary,
                                    const Completion& completion);

    const std::shared_ptr<Platform> platform_;
    const std::string callingProcessBundleID_;
};

}  // namespace qax
