// The crash-trial writer: rewrites the agent's four persisted stores (preference domain,
// warranty cache, follow-up store, activity registry) through the classes the agent writes
// them with, generation after generation, so that a test can kill it at any moment.
//   qax_store_writer HOME ROOT FIRST [LAST]
//       generations FIRST..LAST (without LAST: until killed); prints "ready" before the first
//       write and each generation's number once all four stores hold it
//   qax_store_writer --file-limit BYTES HOME ROOT GENERATION
//       one generation with files limited to BYTES (RLIMIT_FSIZE, SIGXFSZ ignored), as on a
//       full disk; prints "<store> ok|failed" per store, logs on stderr
#include <sys/resource.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>

#include "core/Hash.h"
#include "core/Log.h"
#include "core/VirtualTimeTaskRunner.h"
#include "helpers/CrashTrialStores.h"
#include "platform/Platform.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostBackgroundActivityScheduler.h"
#include "platform/host/HostFollowUpCenter.h"
#include "platform/host/HostLocaleInfo.h"
#include "platform/host/SystemClock.h"
#include "warranty/QAXWarranty.h"

namespace {

using namespace qax;
namespace trial = qax::test::crashtrial;

// While being killed over and over only errors matter; they go to stderr.
class ErrorLogSink : public LogSink {
  public:
    void write(LogLevel, std::string_view, std::string_view, std::string_view message) override {
        std::string line = std::string(message) + "\n";
        (void)!::write(2, line.data(), line.size());
    }
    bool isEnabled(LogLevel level) const override { return level == LogLevel::Error; }
    bool showsPrivate() const override { return true; }
};

void say(const std::string& text) {
    const std::string line = text + "\n";
    (void)!::write(1, line.data(), line.size());
}

class Stores {
  public:
    Stores(const std::string& home, const std::string& root)
        : platform_(std::make_shared<Platform>()) {
        platform_->homeDirectory = home;
        platform_->platformRoot = root;
        platform_->clock = std::make_shared<SystemClock>();
        platform_->locale = std::make_shared<HostLocaleInfo>();
        // Nothing here runs queued work: the scheduler's timers never fire in this process.
        platform_->dispatcher = std::make_shared<VirtualTimeDispatcher>(
            std::make_shared<VirtualTimeTaskRunner>(std::make_shared<ManualClock>()));
        platform_->preferences =
            std::make_shared<FilePreferenceStore>(FilePreferenceStore::domainPath(home));
        followUps_ = std::make_shared<HostFollowUpCenter>(root, platform_->clock);
        HostBackgroundActivityScheduler::Options options;
        options.platformRoot = root;
        options.shareDirectory = root + "/no-launch-configuration";
        options.networkAvailable = [] { return false; };
        scheduler_ = std::make_shared<HostBackgroundActivityScheduler>(platform_, options);
        platform_->activities = scheduler_;
    }

    bool writePreferences(std::int64_t g) {
        return platform_->preferences->setObject(
            trial::kPreferenceKey,
            Value::Dictionary{{trial::kGenerationKey, Value(g)},
                              {trial::kPayloadKey, Value(trial::payload(g))}});
    }

    // As a download leaves it: the file, then the keys that make the agent trust it.
    bool writeCache(std::int64_t g) {
        auto warranty = QAXWarranty::warrantyWithDictionary(platform_, trial::summary(g));
        if (!warranty || !warranty->cacheWarranty(std::string(trial::kSerialNumber))) {
            return false;
        }
        PreferenceStore& preferences = *platform_->preferences;
        const std::string hash = sha256Hash(trial::kSerialNumber);
        return preferences.setObject(hash + "_CachedWarrantyLastUpdatedDate",
                                     Value(platform_->clock->now())) &&
               preferences.setObject(hash + "_CachedWarrantyLocale",
                                     Value(platform_->locale->preferredLocaleIdentifier())) &&
               preferences.setObject(hash + "_CachedWarrantyVersion", Value("2"));
    }

    bool writeFollowUp(std::int64_t g) {
        FollowUpItem item;
        item.uniqueIdentifier = trial::kFollowUpIdentifier;
        item.title = "G" + std::to_string(g);
        item.informativeFooterText = trial::payload(g);
        std::string error;
        return followUps_->postFollowUpItem(trial::kFollowUpClient, item, &error);
    }

    // The scheduler persists a registration as it is made; the delay carries the generation.
    bool writeRegistry(std::int64_t g) {
        auto activity = scheduler_->activityWithIdentifier(trial::kActivityIdentifier);
        ActivityCriteria criteria;
        criteria.delaySeconds = g;
        activity->setCriteria(criteria);
        activity->scheduleWithBlock([](auto completion) { completion(ActivityResult::Finished); });
        const auto records = HostActivityRegistry::load(platform_->platformRoot);
        auto it = records.find(trial::kActivityIdentifier);
        return it != records.end() && it->second.delay == g;
    }

  private:
    std::shared_ptr<Platform> platform_;
    std::shared_ptr<HostFollowUpCenter> followUps_;
    std::shared_ptr<HostBackgroundActivityScheduler> scheduler_;
};

int usage() {
    std::fprintf(stderr,
                 "usage: qax_store_writer HOME ROOT FIRST [LAST]\n"
                 "       qax_store_writer --file-limit BYTES HOME ROOT GENERATION\n");
    return 64;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc >= 6 && std::string(argv[1]) == "--file-limit") {
        qaxLog().setSink(std::make_shared<StderrLogSink>());
        Stores stores(argv[3], argv[4]);
        const std::int64_t g = std::atoll(argv[5]);
        std::signal(SIGXFSZ, SIG_IGN);
        const rlim_t limit = std::strtoull(argv[2], nullptr, 10);
        const rlimit files{limit, limit};
        if (setrlimit(RLIMIT_FSIZE, &files) != 0) {
            std::perror("setrlimit");
            return 1;
        }
        say(std::string("preferences ") + (stores.writePreferences(g) ? "ok" : "failed"));
        say(std::string("cache ") + (stores.writeCache(g) ? "ok" : "failed"));
        say(std::string("followups ") + (stores.writeFollowUp(g) ? "ok" : "failed"));
        say(std::string("registry ") + (stores.writeRegistry(g) ? "ok" : "failed"));
        return 0;
    }
    if (argc < 4 || argc > 5) {
        return usage();
    }
    qaxLog().setSink(std::make_shared<ErrorLogSink>());
    Stores stores(argv[1], argv[2]);
    const std::int64_t first = std::atoll(argv[3]);
    const std::int64_t last = argc == 5 ? std::atoll(argv[4]) : INT64_MAX;
    say("ready");
    for (std::int64_t g = first; g <= last; ++g) {
        if (!stores.writePreferences(g) || !stores.writeCache(g) || !stores.writeFollowUp(g) ||
            !stores.writeRegistry(g)) {
            std::fprintf(stderr, "generation %lld could not be written\n",
                         static_cast<long long>(g));
            return 1;
        }
        say(std::to_string(g));
    }
    return 0;
}
