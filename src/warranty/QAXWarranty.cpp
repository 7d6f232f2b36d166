#include "warranty/QAXWarranty.h"

#include <algorithm>
#include <cmath>
#include <iterator>
#include <limits>
#include <memory>
#include <vector>

#include "core/IcuLibrary.h"
#include "core/Log.h"
#include "platform/LocaleInfo.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"

namespace qax {
namespace {

// A JSON null in a summary means the value is absent. Dropping nulls (from dictionaries and
// arrays, at every depth) keeps the record representable as a property list, so it can be
// cached and archived like any other.
Value withoutNulls(Value value) {
    if (auto* dictionary = value.asDictionary()) {
        for (auto it = dictionary->begin(); it != dictionary->end();) {
            if (it->second.isNull()) {
                it = dictionary->erase(it);
            } else {
                it->second = withoutNulls(std::move(it->second));
                ++it;
            }
        }
    } else if (auto* array = value.asArray()) {
        std::erase_if(*array, [](const Value& element) { return element.isNull(); });
        for (auto& element : *array) {
            element = withoutNulls(std::move(element));
        }
    }
    return value;
}

bool containsNull(const Value& value) {
    if (value.isNull()) {
        return true;
    }
    if (const auto* dictionary = value.asDictionary()) {
        return std::any_of(dictionary->begin(), dictionary->end(),
                           [](const auto& entry) { return containsNull(entry.second); });
    }
    if (const auto* array = value.asArray()) {
        return std::any_of(array->begin(), array->end(), containsNull);
    }
    return false;
}

// Containers of the coverage summary.
constexpr const char* kFeatureToggleParameters = "featureToggleParameters";
constexpr const char* kCoverage = "coverage";
constexpr const char* kBenefitsCard = "benefitsCard";

// Keys at the top level of the summary.
constexpr const char* kCoveredKey = "covered";
constexpr const char* kCoverageEndDateKey = "coverageEndDate";
constexpr const char* kLocalizedCoveredDeviceDateLabelFormatKey =
    "localizedCoveredDeviceDateLabelFormat";
constexpr const char* kCoverageLocalizedLabelKey = "coverageLocalizedLabel";
constexpr const char* kCoverageLocalizedDescKey = "coverageLocalizedDesc";
constexpr const char* kCoverageLocalizedDescLongKey = "coverageLocalizedDescLong";
constexpr const char* kCoverageLocalizedExpirationLabelKey = "coverageLocalizedExpirationLabel";
constexpr const char* kFooter1FormatStringKey = "footer1FormatString";
constexpr const char* kFooter1LinkLabelKey = "footer1LinkLabel";
constexpr const char* kFooter1LinkURLKey = "footer1LinkURL";
constexpr const char* kFooter2FormatStringKey = "footer2FormatString";
constexpr const char* kFooter2LinkLabelKey = "footer2LinkLabel";
constexpr const char* kFooter2LinkURLKey = "footer2LinkURL";
constexpr const char* kHvOfferEligibleKey = "hvOfferEligible";
constexpr const char* kHvOfferEligibleUntilKey = "hvOfferEligibleUntil";
constexpr const char* kHvOfferFollowupDisplayDateKey = "hvOfferFollowupDisplayDate";
constexpr const char* kHvOfferDisplayDateKey = "hvOfferDisplayDate";
constexpr const char* kHvOfferIdentifierKey = "hvOfferIdentifier";
constexpr const char* kHvLocalizedOfferLabelKey = "hvLocalizedOfferLabel";
constexpr const char* kHvLocalizedOfferPluralDescFormatKey = "hvLocalizedOfferPluralDescFormat";
constexpr const char* kHvLocalizedOfferSingularDescKey = "hvLocalizedOfferSingularDesc";
constexpr const char* kHvNotificationLocalizedOfferLabelKey = "hvNotificationLocalizedOfferLabel";
constexpr const char* kHvNotificationLocalizedOfferSingularDescKey =
    "hvNotificationLocalizedOfferSingularDesc";
constexpr const char* kHvNotificationLocalizedOfferPluralDescFormatKey =
    "hvNotificationLocalizedOfferPluralDescFormat";
constexpr const char* kHvLocalizedOfferCTAKey = "hvLocalizedOfferCTA";
constexpr const char* kHvLocalizedOfferDetailsKey = "hvLocalizedOfferDetails";
constexpr const char* kHvLocalizedOfferDetailsPluralEligibilityFormatKey =
    "hvLocalizedOfferDetailsPluralEligibilityFormat";
constexpr const char* kHvLocalizedOfferDetailsSingularEligibilityKey =
    "hvLocalizedOfferDetailsSingularEligibility";
constexpr const char* kHvOfferPromoFormatKey = "hvOfferPromoFormat";
constexpr const char* kHvOfferPromoNewKey = "hvOfferPromoNew";
// Read twice: once as a day count turned into seconds, once as the number itself.
constexpr const char* kHvOfferBadgeBeforeEndDateKey = "hvOfferBadgeBeforeEndDate";
constexpr const char* kHvLogoToggleKey = "hvLogoToggle";
constexpr const char* kHvServicesPartnerKey = "hvServicesPartner";
constexpr const char* kLocalizedSupportAppLabelKey = "localizedSupportAppLabel";
constexpr const char* kLocalizedSupportAppFooterKey = "localizedSupportAppFooter";
constexpr const char* kIsHvSubscriptionKey = "isHvSubscription";
constexpr const char* kLocalizedManagePlanLabelKey = "localizedManagePlanLabel";
constexpr const char* kIsHvServicesPartnerKey = "isHvServicesPartner";
constexpr const char* kHvOfferConversionDateKey = "hvOfferConversionDate";
constexpr const char* kDisplayRepairAndSupportKey = "displayRepairAndSupport";
constexpr const char* kAgsURLKey = "agsURL";
constexpr const char* kSupportAppURLKey = "supportAppURL";
constexpr const char* kShowNotificationToggleKey = "showNotificationToggle";
constexpr const char* kShowNotificationBeforeEndDateKey = "showNotificationBeforeEndDate";

// Keys inside "featureToggleParameters".
constexpr const char* kHvOfferDisplayKey = "hvOfferDisplay";
constexpr const char* kHvOfferSettingsAppBadgeKey = "hvOfferSettingsAppBadge";
constexpr const char* kHvOfferSettingsRowBadgeKey = "hvOfferSettingsRowBadge";
constexpr const char* kHvOfferDurationDaysBeforeEndDateKey = "hvOfferDurationDaysBeforeEndDate";
constexpr const char* kHvOfferToggleKey = "hvOfferToggle";

// Keys inside "coverage".
constexpr const char* kLocalizedCoverageFooterFormatStringKey =
    "localizedCoverageFooterFormatString";
constexpr const char* kLocalizedCoverageFooterLinkLabelKey = "localizedCoverageFooterLinkLabel";
constexpr const char* kLocalizedCoverageTitleKey = "localizedCoverageTitle";
constexpr const char* kCoverageDetailsKey = "coverageDetails";

// Keys inside "coverage" -> "benefitsCard".
constexpr const char* kLocalizedBenefitsCardTitleKey = "localizedBenefitsCardTitle";
constexpr const char* kLocalizedBenefitsCardSubTitleKey = "localizedBenefitsCardSubTitle";
constexpr const char* kBenefitDetailsKey = "benefitDetails";
constexpr const char* kLocalizedBenefitsCardFooterKey = "localizedBenefitsCardFooter";

// Overrides the conversion date of every record when it holds an epoch number.
constexpr const char* kConversionDateSetting = "ConversionDate";

// Day counts of the summary are whole days of fixed length, whatever "OneDayInterval" says.
constexpr double kSecondsPerDay = 86400.0;
// Epoch numbers above this are milliseconds.
constexpr std::uint64_t kLargestEpochInSeconds = 10'000'000'000ULL;

constexpr const char* kArchiveClassKey = "$class";
constexpr const char* kArchiveClassName = "QAXWarranty";
constexpr const char* kArchiveDictionaryKey = "DictionaryRepresentation";

const Value* nested(const Value& dictionary, const char* container, const char* key) {
    const Value* c = dictionary.find(container);
    return c ? c->find(key) : nullptr;
}

const Value* inBenefitsCard(const Value& dictionary, const char* key) {
    const Value* coverage = dictionary.find(kCoverage);
    const Value* card = coverage ? coverage->find(kBenefitsCard) : nullptr;
    return card ? card->find(key) : nullptr;
}

bool flag(const Value* v) {
    return v && v->truthy();
}

double daysInSeconds(const Value* v) {
    if (!v) {
        return 0;
    }
    if (auto d = v->asDouble()) {
        return *d * kSecondsPerDay;
    }
    return v->isBool() && v->truthy() ? kSecondsPerDay : 0;
}

std::uint64_t asUnsigned64(const Value& number) {
    if (number.isInteger()) {
        // Negative counts wrap, as an unsigned conversion does.
        return static_cast<std::uint64_t>(*number.asInteger());
    }
    const double d = *number.asDouble();
    if (std::isnan(d)) {
        return 0;
    }
    if (d >= 18446744073709551615.0) {
        return std::numeric_limits<std::uint64_t>::max();
    }
    if (d >= 0) {
        return static_cast<std::uint64_t>(d);
    }
    return static_cast<std::uint64_t>(*number.asInteger());
}

// The count in the user's locale: its digits and grouping separators. Formatters are
// costly to make, so each thread keeps the last one it made.
std::string formatCount(std::uint32_t count, const std::string& localeIdentifier) {
    const IcuLibrary* icu = IcuLibrary::get();
    if (!icu) {
        return std::to_string(count);
    }
    struct Close {
        void operator()(UNumberFormat* f) const { IcuLibrary::get()->numberFormatClose(f); }
    };
    struct CachedFormatter {
        std::string localeIdentifier;
        std::unique_ptr<UNumberFormat, Close> formatter;
    };
    thread_local CachedFormatter cached;
    if (!cached.formatter || cached.localeIdentifier != localeIdentifier) {
        UErrorCode status = U_ZERO_ERROR;
        std::unique_ptr<UNumberFormat, Close> formatter(icu->numberFormatOpen(
            UNUM_DECIMAL, nullptr, 0, localeIdentifier.c_str(), nullptr, &status));
        if (U_FAILURE(status) || !formatter) {
            return std::to_string(count);
        }
        cached = {localeIdentifier, std::move(formatter)};
    }
    UChar digits[64];
    UErrorCode status = U_ZERO_ERROR;
    const int32_t units = icu->numberFormatInt64(cached.formatter.get(), count, digits,
                                                 std::size(digits), nullptr, &status);
    char text[256];
    int32_t length = 0;
    if (U_SUCCESS(status)) {
        icu->strToUTF8(text, sizeof text, &length, digits, units, &status);
    }
    return U_SUCCESS(status) ? std::string(text, static_cast<std::size_t>(length))
                             : std::to_string(count);
}

// Puts `argument` in place of the format's object placeholder ("%@", or "%1$@" in
// translations that number their arguments); "%%" is a literal percent sign.
std::string substituteObject(const std::string& format, const std::string& argument) {
    std::string out;
    out.reserve(format.size() + argument.size());
    for (std::size_t i = 0; i < format.size(); ++i) {
        if (format[i] == '%' && i + 1 < format.size()) {
            if (format[i + 1] == '@') {
                out += argument;
                ++i;
                continue;
            }
            if (format.compare(i + 1, 3, "1$@") == 0) {
                out += argument;
                i += 3;
                continue;
            }
            if (format[i + 1] == '%') {
                out += '%';
                ++i;
                continue;
            }
        }
        out += format[i];
    }
    return out;
}

// Only dictionaries, arrays, strings, numbers (booleans among them) and dates may cross IPC
// inside a record. Walks without recursion so that a deep tree cannot exhaust the stack.
bool holdsOnlyArchivableKinds(const Value& root) {
    std::vector<const Value*> pending{&root};
    while (!pending.empty()) {
        const Value* v = pending.back();
        pending.pop_back();
        switch (v->kind()) {
            case Value::Kind::Bool:
            case Value::Kind::Integer:
            case Value::Kind::Real:
            case Value::Kind::String:
            case Value::Kind::Date:
                break;
            case Value::Kind::Array:
                for (const auto& e : *v->asArray()) {
                    pending.push_back(&e);
                }
                break;
            case Value::Kind::Dictionary:
                for (const auto& [k, e] : *v->asDictionary()) {
                    pending.push_back(&e);
                }
                break;
            case Value::Kind::Null:
            case Value::Kind::Data:
                return false;
        }
    }
    return true;
}

}  // namespace

std::shared_ptr<QAXWarranty> QAXWarranty::warrantyWithDictionary(
    std::shared_ptr<Platform> platform, std::optional<Value> dictionary,
    const std::optional<std::string>& serialNumber) {
    static constexpr const char* kOperation = "+[QAXWarranty warrantyWithDictionary:serialNumber:]";
    auto warranty = initWithDictionary(std::move(platform), std::move(dictionary), serialNumber);
    qaxLog().info("%s : %d", kOperation, warranty ? 1 : 0);
    return warranty;
}

std::shared_ptr<QAXWarranty> QAXWarranty::initWithDictionary(
    std::shared_ptr<Platform> platform, std::optional<Value> dictionary,
    const std::optional<std::string>& serialNumber) {
    if (!dictionary || !dictionary->isDictionary()) {
        return nullptr;
    }
    return std::make_shared<QAXWarranty>(std::move(platform), std::move(*dictionary), serialNumber);
}

std::shared_ptr<QAXWarranty> QAXWarranty::warrantyWithSharedDictionary(
    std::shared_ptr<Platform> platform, std::shared_ptr<const Value> dictionary) {
    static constexpr const char* kOperation = "+[QAXWarranty warrantyWithDictionary:serialNumber:]";
    std::shared_ptr<QAXWarranty> warranty;
    if (dictionary && dictionary->isDictionary()) {
        warranty = std::make_shared<QAXWarranty>(std::move(platform), std::move(dictionary));
    }
    qaxLog().info("%s : %d", kOperation, warranty ? 1 : 0);
    return warranty;
}

QAXWarranty::QAXWarranty(std::shared_ptr<Platform> platform, Value dictionary,
                         const std::optional<std::string>& serialNumber)
    : QAXWarranty(std::move(platform),
                  std::make_shared<const Value>(withoutNulls(std::move(dictionary))),
                  serialNumber) {}

QAXWarranty::QAXWarranty(std::shared_ptr<Platform> platform,
                         std::shared_ptr<const Value> dictionary,
                         const std::optional<std::string>& /*serialNumber*/)
    : platform_(std::move(platform)),
      dictionary_(containsNull(*dictionary)
                      ? std::make_shared<const Value>(withoutNulls(Value(*dictionary)))
                      : std::move(dictionary)) {
    const Value& d = *dictionary_;
    auto top = [&d](const char* key) { return d.find(key); };
    auto toggles = [&d](const char* key) { return nested(d, kFeatureToggleParameters, key); };
    auto coverage = [&d](const char* key) { return nested(d, kCoverage, key); };
    auto card = [&d](const char* key) { return inBenefitsCard(d, key); };

    Fields& f = fields_;
    f.covered = flag(top(kCoveredKey));
    f.coverageEndDate = _dateWithEpochNumber(top(kCoverageEndDateKey));
    f.localizedCoveredDeviceDateLabelFormat =
        ValueField(top(kLocalizedCoveredDeviceDateLabelFormatKey));
    f.coverageLocalizedLabel = ValueField(top(kCoverageLocalizedLabelKey));
    f.coverageLocalizedDesc = ValueField(top(kCoverageLocalizedDescKey));
    f.coverageLocalizedDescLong = ValueField(top(kCoverageLocalizedDescLongKey));
    f.coverageLocalizedExpirationLabel = ValueField(top(kCoverageLocalizedExpirationLabelKey));
    f.footer1FormatString = ValueField(top(kFooter1FormatStringKey));
    f.footer1LinkLabel = ValueField(top(kFooter1LinkLabelKey));
    f.footer1LinkURL = ValueField(top(kFooter1LinkURLKey));
    f.footer2FormatString = ValueField(top(kFooter2FormatStringKey));
    f.footer2LinkLabel = ValueField(top(kFooter2LinkLabelKey));
    f.footer2LinkURL = ValueField(top(kFooter2LinkURLKey));
    f.hvOfferEligible = flag(top(kHvOfferEligibleKey));
    f.hvOfferEligibleUntil = _dateWithEpochNumber(top(kHvOfferEligibleUntilKey));
    f.hvOfferFollowupDisplayDate = _dateWithEpochNumber(top(kHvOfferFollowupDisplayDateKey));
    f.hvOfferDisplayDate = _dateWithEpochNumber(top(kHvOfferDisplayDateKey));
    f.hvOfferIdentifier = ValueField(top(kHvOfferIdentifierKey));
    f.hvLocalizedOfferLabel = ValueField(top(kHvLocalizedOfferLabelKey));
    f.hvLocalizedOfferPluralDescFormat = ValueField(top(kHvLocalizedOfferPluralDescFormatKey));
    f.hvLocalizedOfferSingularDesc = ValueField(top(kHvLocalizedOfferSingularDescKey));
    f.hvNotificationLocalizedOfferLabel = ValueField(top(kHvNotificationLocalizedOfferLabelKey));
    f.hvNotificationLocalizedOfferSingularDesc =
        ValueField(top(kHvNotificationLocalizedOfferSingularDescKey));
    f.hvNotificationLocalizedOfferPluralDescFormat =
        ValueField(top(kHvNotificationLocalizedOfferPluralDescFormatKey));
    f.hvLocalizedOfferCTA = ValueField(top(kHvLocalizedOfferCTAKey));
    f.hvLocalizedOfferDetails = ValueField(top(kHvLocalizedOfferDetailsKey));
    f.hvLocalizedOfferDetailsPluralEligibilityFormat =
        ValueField(top(kHvLocalizedOfferDetailsPluralEligibilityFormatKey));
    f.hvLocalizedOfferDetailsSingularEligibility =
        ValueField(top(kHvLocalizedOfferDetailsSingularEligibilityKey));
    f.hvOfferDisplay = flag(toggles(kHvOfferDisplayKey));
    f.hvOfferSettingsAppBadge = flag(toggles(kHvOfferSettingsAppBadgeKey));
    f.hvOfferSettingsRowBadge = flag(toggles(kHvOfferSettingsRowBadgeKey));
    f.hvOfferDurationBeforeEndDate = daysInSeconds(toggles(kHvOfferDurationDaysBeforeEndDateKey));
    f.hvOfferToggle = ValueField(toggles(kHvOfferToggleKey));
    f.hvOfferPromoFormat = ValueField(top(kHvOfferPromoFormatKey));
    f.hvOfferPromoNew = ValueField(top(kHvOfferPromoNewKey));
    f.hvOfferBadgeDurationBeforeEndDate = daysInSeconds(top(kHvOfferBadgeBeforeEndDateKey));
    f.coverageHasHVLogo = flag(top(kHvLogoToggleKey));
    f.localizedCoverageSubTitleForServicesPartnerString = ValueField(top(kHvServicesPartnerKey));
    f.localizedCoverageFooterFormatString =
        ValueField(coverage(kLocalizedCoverageFooterFormatStringKey));
    f.localizedCoverageFooterLinkLabel = ValueField(coverage(kLocalizedCoverageFooterLinkLabelKey));
    f.localizedSupportAppLabel = ValueField(top(kLocalizedSupportAppLabelKey));
    f.localizedSupportAppFooter = ValueField(top(kLocalizedSupportAppFooterKey));
    f.isCoveragePlanSubscriptionType = flag(top(kIsHvSubscriptionKey));
    f.localizedManagePlanLabel = ValueField(top(kLocalizedManagePlanLabelKey));
    f.hvOfferBadgeDaysBeforeEndDate = ValueField(top(kHvOfferBadgeBeforeEndDateKey));
    f.isHVServicesPartner = flag(top(kIsHvServicesPartnerKey));
    // After the end date, which it may be derived from.
    f.hvOfferConversionDate = conversionDate(d, f.coverageEndDate);
    f.coverageDetailsDictionary = ValueField(top(kCoverage));
    f.localizedCoverageDetailsTitle = ValueField(coverage(kLocalizedCoverageTitleKey));
    f.coverageDetailsArray = ValueField(coverage(kCoverageDetailsKey));
    f.coverageBenefitsDictionary = ValueField(coverage(kBenefitsCard));
    f.localizedBenefitsCardTitle = ValueField(card(kLocalizedBenefitsCardTitleKey));
    f.localizedBenefitsCardSubTitle = ValueField(card(kLocalizedBenefitsCardSubTitleKey));
    f.benefitDetailsArray = ValueField(card(kBenefitDetailsKey));
    f.localizedBenefitsCardFooter = ValueField(card(kLocalizedBenefitsCardFooterKey));
    f.displayRepairAndSupport = flag(top(kDisplayRepairAndSupportKey));
    f.agsURL = ValueField(top(kAgsURLKey));
    f.supportAppURL = ValueField(top(kSupportAppURLKey));
    f.showNotificationToggle = flag(top(kShowNotificationToggleKey));
    f.showNotificationBeforeEndDate = daysInSeconds(top(kShowNotificationBeforeEndDateKey));
}

std::optional<Date> QAXWarranty::_dateWithEpochNumber(const Value* number) {
    if (!number || !number->isNumber()) {
        return std::nullopt;
    }
    std::uint64_t n = asUnsigned64(*number);
    if (n > kLargestEpochInSeconds) {
        n /= 1000;
    }
    return Date(static_cast<double>(n));
}

std::optional<Date> QAXWarranty::conversionDate(const Value& dictionary,
                                                std::optional<Date> coverageEndDate) const {
    PreferenceStore* preferences = platform_ ? platform_->preferences.get() : nullptr;
    if (preferences) {
        if (auto overridden =
                _dateWithEpochNumber(preferences->objectForKey(kConversionDateSetting))) {
            return overridden;
        }
    }
    if (const Value* fromService = dictionary.find(kHvOfferConversionDateKey)) {
        // The service sends 0 to say the device has no conversion date.
        if (!fromService->isNumber() || *fromService->asDouble() == 0) {
            return std::nullopt;
        }
        return _dateWithEpochNumber(fromService);
    }
    if (!coverageEndDate) {
        return std::nullopt;
    }
    const double oneDay = preferences ? preferences->doubleForKey(settings::kOneDayInterval) : 0;
    return coverageEndDate->byAdding(oneDay);
}

std::uint32_t QAXWarranty::daysEligible() const {
    double interval = 0;
    if (platform_ && platform_->preferences) {
        interval = platform_->preferences->doubleForKey(settings::kOneDayInterval);
    }
    if (!(interval > 0)) {
        interval = kSecondsPerDay;
    }
    double seconds = 0;
    if (auto until = hvOfferEligibleUntil(); until && platform_ && platform_->clock) {
        seconds = until->timeIntervalSince(platform_->clock->now());
    }
    const double days = std::ceil(seconds / interval);
    if (!(days > 0)) {
        return 0;
    }
    if (days >= static_cast<double>(std::numeric_limits<std::uint32_t>::max())) {
        return std::numeric_limits<std::uint32_t>::max();
    }
    return static_cast<std::uint32_t>(days);
}

std::optional<std::string> QAXWarranty::offerText(std::optional<Value> pluralFormat,
                                                  std::optional<Value> singular,
                                                  const char* notAStringMessage) const {
    const std::uint32_t days = daysEligible();
    if (days <= 1) {
        if (singular) {
            if (const std::string* s = singular->asString()) {
                return *s;
            }
        }
        return std::nullopt;
    }
    const std::string* format = pluralFormat ? pluralFormat->asString() : nullptr;
    if (!format) {
        qaxLog().error(notAStringMessage);
        return std::nullopt;
    }
    std::string localeIdentifier;
    if (platform_ && platform_->locale) {
        localeIdentifier = platform_->locale->preferredLocaleIdentifier();
    }
    return substituteObject(*format, formatCount(days, localeIdentifier));
}

std::optional<std::string> QAXWarranty::hvLocalizedOfferDesc() const {
    static constexpr const char* kNotAString =
        "hvLocalizedOfferDesc: hvLocalizedOfferPluralDescFormat is not a string";
    return offerText(hvLocalizedOfferPluralDescFormat(), hvLocalizedOfferSingularDesc(),
                     kNotAString);
}

std::optional<std::string> QAXWarranty::hvLocalizedNotificationOfferDesc() const {
    static constexpr const char* kNotAString =
        "hvLocalizedNotificationOfferDesc: hvNotificationLocalizedOfferPluralDescFormat is not a "
        "string";
    return offerText(hvNotificationLocalizedOfferPluralDescFormat(),
                     hvNotificationLocalizedOfferSingularDesc(), kNotAString);
}

std::optional<std::string> QAXWarranty::hvLocalizedOfferDetailsEligibility() const {
    static constexpr const char* kNotAString =
        "hvLocalizedOfferDetailsEligibility: hvLocalizedOfferDetailsPluralEligibilityFormat is not "
        "a string";
    return offerText(hvLocalizedOfferDetailsPluralEligibilityFormat(),
                     hvLocalizedOfferDetailsSingularEligibility(), kNotAString);
}

std::string QAXWarranty::description() const {
    return dictionary_->description();
}

bool QAXWarranty::isEqual(const QAXWarranty* other) const {
    if (other == this) {
        return true;
    }
    return other && *dictionary_ == *other->dictionary_;
}

Value QAXWarranty::encode() const {
    Value archive{Value::Dictionary{}};
    archive[kArchiveClassKey] = kArchiveClassName;
    archive[kArchiveDictionaryKey] = *dictionary_;
    return archive;
}

std::shared_ptr<QAXWarranty> QAXWarranty::decode(std::shared_ptr<Platform> platform,
                                                 const Value& archive) {
    const Value* className = archive.find(kArchiveClassKey);
    if (!className || !className->asString() || *className->asString() != kArchiveClassName) {
        return nullptr;
    }
    const Value* dictionary = archive.find(kArchiveDictionaryKey);
    if (!dictionary || !dictionary->isDictionary() || !holdsOnlyArchivableKinds(*dictionary)) {
        return nullptr;
    }
    return initWithDictionary(std::move(platform), *dictionary);
}

}  // namespace qax
