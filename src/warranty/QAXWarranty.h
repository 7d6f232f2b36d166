// One device's coverage: the coverage summary dictionary as the service returned it, its
// typed fields and the derived offer texts and day count. Each getter and setter locks the
// record for its own read or write, so records may be shared across threads (fields are not
// consistent with each other). The summary dictionary itself is fixed at construction.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "core/Date.h"
#include "core/Value.h"

namespace qax {

struct Platform;

class QAXWarranty {
  public:
    // Builds the record from a coverage summary (a dictionary; anything else yields no
    // record) and logs whether one was made. The serial number is accepted and not kept.
    static std::shared_ptr<QAXWarranty> warrantyWithDictionary(
        std::shared_ptr<Platform> platform, std::optional<Value> dictionary,
        const std::optional<std::string>& serialNumber = std::nullopt);

    // The same without the log line: none for a missing or non-dictionary value.
    static std::shared_ptr<QAXWarranty> initWithDictionary(
        std::shared_ptr<Platform> platform, std::optional<Value> dictionary,
        const std::optional<std::string>& serialNumber = std::nullopt);

    // Fills every field from `dictionary`. The platform supplies the preference store (the
    // conversion-date override, the day length), the clock and the locale.
    QAXWarranty(std::shared_ptr<Platform> platform, Value dictionary,
                const std::optional<std::string>& serialNumber = std::nullopt);
    // The same from a tree shared with its reader (a parsed cache file): the record keeps the
    // tree as it is (it never changes it), copying it only if it holds nulls to drop.
    QAXWarranty(std::shared_ptr<Platform> platform, std::shared_ptr<const Value> dictionary,
                const std::optional<std::string>& serialNumber = std::nullopt);
    // warrantyWithDictionary for such a tree: the same log line, none for a missing tree or
    // one that is not a dictionary.
    static std::shared_ptr<QAXWarranty> warrantyWithSharedDictionary(
        std::shared_ptr<Platform> platform, std::shared_ptr<const Value> dictionary);

    QAXWarranty(const QAXWarranty&) = delete;
    QAXWarranty& operator=(const QAXWarranty&) = delete;

    // Epoch number of the coverage summary to a date: integers above 10,000,000,000 are
    // milliseconds, others seconds; anything that is not a number gives no date.
    static std::optional<Date> _dateWithEpochNumber(const Value* number);
    static std::optional<Date> _dateWithEpochNumber(const std::optional<Value>& number) {
        return _dateWithEpochNumber(number ? &*number : nullptr);
    }

    const std::shared_ptr<Platform>& platform() const { return platform_; }

    // Flags are false, durations 0 and everything else empty when the summary lacks them.
    bool covered() const { return get(&Fields::covered); }
    std::optional<Date> coverageEndDate() const { return get(&Fields::coverageEndDate); }
    std::optional<Date> coverageValidityDate() const { return get(&Fields::coverageValidityDate); }
    std::optional<Value> localizedCoveredDeviceDateLabelFormat() const {
        return get(&Fields::localizedCoveredDeviceDateLabelFormat);
    }
    std::optional<Value> coverageLocalizedLabel() const {
        return get(&Fields::coverageLocalizedLabel);
    }
    std::optional<Value> coverageLocalizedDesc() const {
        return get(&Fields::coverageLocalizedDesc);
    }
    std::optional<Value> coverageLocalizedDescLong() const {
        return get(&Fields::coverageLocalizedDescLong);
    }
    std::optional<Value> coverageLocalizedExpirationLabel() const {
        return get(&Fields::coverageLocalizedExpirationLabel);
    }
    std::optional<Value> footer1FormatString() const { return get(&Fields::footer1FormatString); }
    std::optional<Value> footer1LinkLabel() const { return get(&Fields::footer1LinkLabel); }
    std::optional<Value> footer1LinkURL() const { return get(&Fields::footer1LinkURL); }
    std::optional<Value> footer2FormatString() const { return get(&Fields::footer2FormatString); }
    std::optional<Value> footer2LinkLabel() const { return get(&Fields::footer2LinkLabel); }
    std::optional<Value> footer2LinkURL() const { return get(&Fields::footer2LinkURL); }
    bool hvOfferEligible() const { return get(&Fields::hvOfferEligible); }
    std::optional<Date> hvOfferEligibleUntil() const { return get(&Fields::hvOfferEligibleUntil); }
    std::optional<Date> hvOfferFollowupDisplayDate() const {
        return get(&Fields::hvOfferFollowupDisplayDate);
    }
    std::optional<Date> hvOfferDisplayDate() const { return get(&Fields::hvOfferDisplayDate); }
    std::optional<Value> hvOfferIdentifier() const { return get(&Fields::hvOfferIdentifier); }
    std::optional<Value> hvLocalizedOfferLabel() const {
        return get(&Fields::hvLocalizedOfferLabel);
    }
    std::optional<Value> hvLocalizedOfferPluralDescFormat() const {
        return get(&Fields::hvLocalizedOfferPluralDescFormat);
    }
    std::optional<Value> hvLocalizedOfferSingularDesc() const {
        return get(&Fields::hvLocalizedOfferSingularDesc);
    }
    std::optional<Value> hvNotificationLocalizedOfferLabel() const {
        return get(&Fields::hvNotificationLocalizedOfferLabel);
    }
    std::optional<Value> hvNotificationLocalizedOfferSingularDesc() const {
        return get(&Fields::hvNotificationLocalizedOfferSingularDesc);
    }
    std::optional<Value> hvNotificationLocalizedOfferPluralDescFormat() const {
        return get(&Fields::hvNotificationLocalizedOfferPluralDescFormat);
    }
    std::optional<Value> hvLocalizedOfferCTA() const { return get(&Fields::hvLocalizedOfferCTA); }
    std::optional<Value> hvLocalizedOfferDetails() const {
        return get(&Fields::hvLocalizedOfferDetails);
    }
    std::optional<Value> hvLocalizedOfferDetailsPluralEligibilityFormat() const {
        return get(&Fields::hvLocalizedOfferDetailsPluralEligibilityFormat);
    }
    std::optional<Value> hvLocalizedOfferDetailsSingularEligibility() const {
        return get(&Fields::hvLocalizedOfferDetailsSingularEligibility);
    }
    bool hvOfferDisplay() const { return get(&Fields::hvOfferDisplay); }
    bool hvOfferSettingsAppBadge() const { return get(&Fields::hvOfferSettingsAppBadge); }
    bool hvOfferSettingsRowBadge() const { return get(&Fields::hvOfferSettingsRowBadge); }
    double hvOfferDurationBeforeEndDate() const {
        return get(&Fields::hvOfferDurationBeforeEndDate);
    }
    std::optional<Value> hvOfferToggle() const { return get(&Fields::hvOfferToggle); }
    std::optional<Value> hvOfferPromoFormat() const { return get(&Fields::hvOfferPromoFormat); }
    std::optional<Value> hvOfferPromoNew() const { return get(&Fields::hvOfferPromoNew); }
    double hvOfferBadgeDurationBeforeEndDate() const {
        return get(&Fields::hvOfferBadgeDurationBeforeEndDate);
    }
    bool coverageHasHVLogo() const { return get(&Fields::coverageHasHVLogo); }
    std::optional<Value> localizedCoverageSubTitleForServicesPartnerString() const {
        return get(&Fields::localizedCoverageSubTitleForServicesPartnerString);
    }
    std::optional<Value> localizedCoverageFooterFormatString() const {
        return get(&Fields::localizedCoverageFooterFormatString);
    }
    std::optional<Value> localizedCoverageFooterLinkLabel() const {
        return get(&Fields::localizedCoverageFooterLinkLabel);
    }
    std::optional<Value> localizedSupportAppLabel() const {
        return get(&Fields::localizedSupportAppLabel);
    }
    std::optional<Value> localizedSupportAppFooter() const {
        return get(&Fields::localizedSupportAppFooter);
    }
    bool isCoveragePlanSubscriptionType() const {
        return get(&Fields::isCoveragePlanSubscriptionType);
    }
    std::optional<Value> localizedManagePlanLabel() const {
        return get(&Fields::localizedManagePlanLabel);
    }
    std::optional<Value> hvOfferBadgeDaysBeforeEndDate() const {
        return get(&Fields::hvOfferBadgeDaysBeforeEndDate);
    }
    bool isHVServicesPartner() const { return get(&Fields::isHVServicesPartner); }
    std::optional<Date> hvOfferConversionDate() const {
        return get(&Fields::hvOfferConversionDate);
    }
    std::optional<Value> coverageDetailsDictionary() const {
        return get(&Fields::coverageDetailsDictionary);
    }
    std::optional<Value> localizedCoverageDetailsTitle() const {
        return get(&Fields::localizedCoverageDetailsTitle);
    }
    std::optional<Value> coverageDetailsArray() const { return get(&Fields::coverageDetailsArray); }
    std::optional<Value> localizedCoverageDetailsLabel() const {
        return get(&Fields::localizedCoverageDetailsLabel);
    }
    std::optional<Value> localizedCoverageDetailsValue() const {
        return get(&Fields::localizedCoverageDetailsValue);
    }
    std::optional<Value> coverageBenefitsDictionary() const {
        return get(&Fields::coverageBenefitsDictionary);
    }
    std::optional<Value> localizedBenefitsCardTitle() const {
        return get(&Fields::localizedBenefitsCardTitle);
    }
    std::optional<Value> localizedBenefitsCardSubTitle() const {
        return get(&Fields::localizedBenefitsCardSubTitle);
    }
    std::optional<Value> benefitDetailsArray() const { return get(&Fields::benefitDetailsArray); }
    std::optional<Value> localizedBenefitLabelKey() const {
        return get(&Fields::localizedBenefitLabelKey);
    }
    std::optional<Value> localizedBenefitValueKey() const {
        return get(&Fields::localizedBenefitValueKey);
    }
    std::optional<Value> localizedBenefitsCardFooter() const {
        return get(&Fields::localizedBenefitsCardFooter);
    }
    bool displayRepairAndSupport() const { return get(&Fields::displayRepairAndSupport); }
    std::optional<Value> agsURL() const { return get(&Fields::agsURL); }
    std::optional<Value> supportAppURL() const { return get(&Fields::supportAppURL); }
    // The whole summary the record was built from: what is cached, archived, compared and
    // printed.
    const Value& dictionaryRepresentation() const { return *dictionary_; }
    std::optional<std::string> serialNumber() const { return get(&Fields::serialNumber); }
    bool showNotificationToggle() const { return get(&Fields::showNotificationToggle); }
    double showNotificationBeforeEndDate() const {
        return get(&Fields::showNotificationBeforeEndDate);
    }

    void setCovered(bool v) { set(&Fields::covered, v); }
    void setCoverageEndDate(std::optional<Date> v) { set(&Fields::coverageEndDate, v); }
    void setCoverageValidityDate(std::optional<Date> v) { set(&Fields::coverageValidityDate, v); }
    void setLocalizedCoveredDeviceDateLabelFormat(std::optional<Value> v) {
        set(&Fields::localizedCoveredDeviceDateLabelFormat, std::move(v));
    }
    void setCoverageLocalizedLabel(std::optional<Value> v) {
        set(&Fields::coverageLocalizedLabel, std::move(v));
    }
    void setCoverageLocalizedDesc(std::optional<Value> v) {
        set(&Fields::coverageLocalizedDesc, std::move(v));
    }
    void setCoverageLocalizedDescLong(std::optional<Value> v) {
        set(&Fields::coverageLocalizedDescLong, std::move(v));
    }
    void setCoverageLocalizedExpirationLabel(std::optional<Value> v) {
        set(&Fields::coverageLocalizedExpirationLabel, std::move(v));
    }
    void setFooter1FormatString(std::optional<Value> v) {
        set(&Fields::footer1FormatString, std::move(v));
    }
    void setFooter1LinkLabel(std::optional<Value> v) {
        set(&Fields::footer1LinkLabel, std::move(v));
    }
    void setFooter1LinkURL(std::optional<Value> v) { set(&Fields::footer1LinkURL, std::move(v)); }
    void setFooter2FormatString(std::optional<Value> v) {
        set(&Fields::footer2FormatString, std::move(v));
    }
    void setFooter2LinkLabel(std::optional<Value> v) {
        set(&Fields::footer2LinkLabel, std::move(v));
    }
    void setFooter2LinkURL(std::optional<Value> v) { set(&Fields::footer2LinkURL, std::move(v)); }
    void setHvOfferEligible(bool v) { set(&Fields::hvOfferEligible, v); }
    void setHvOfferEligibleUntil(std::optional<Date> v) { set(&Fields::hvOfferEligibleUntil, v); }
    void setHvOfferFollowupDisplayDate(std::optional<Date> v) {
        set(&Fields::hvOfferFollowupDisplayDate, v);
    }
    void setHvOfferDisplayDate(std::optional<Date> v) { set(&Fields::hvOfferDisplayDate, v); }
    void setHvOfferIdentifier(std::optional<Value> v) {
        set(&Fields::hvOfferIdentifier, std::move(v));
    }
    void setHvLocalizedOfferLabel(std::optional<Value> v) {
        set(&Fields::hvLocalizedOfferLabel, std::move(v));
    }
    void setHvLocalizedOfferPluralDescFormat(std::optional<Value> v) {
        set(&Fields::hvLocalizedOfferPluralDescFormat, std::move(v));
    }
    void setHvLocalizedOfferSingularDesc(std::optional<Value> v) {
        set(&Fields::hvLocalizedOfferSingularDesc, std::move(v));
    }
    void setHvNotificationLocalizedOfferLabel(std::optional<Value> v) {
        set(&Fields::hvNotificationLocalizedOfferLabel, std::move(v));
    }
    void setHvNotificationLocalizedOfferSingularDesc(std::optional<Value> v) {
        set(&Fields::hvNotificationLocalizedOfferSingularDesc, std::move(v));
    }
    void setHvNotificationLocalizedOfferPluralDescFormat(std::optional<Value> v) {
        set(&Fields::hvNotificationLocalizedOfferPluralDescFormat, std::move(v));
    }
    void setHvLocalizedOfferCTA(std::optional<Value> v) {
        set(&Fields::hvLocalizedOfferCTA, std::move(v));
    }
    void setHvLocalizedOfferDetails(std::optional<Value> v) {
        set(&Fields::hvLocalizedOfferDetails, std::move(v));
    }
    void setHvLocalizedOfferDetailsPluralEligibilityFormat(std::optional<Value> v) {
        set(&Fields::hvLocalizedOfferDetailsPluralEligibilityFormat, std::move(v));
    }
    void setHvLocalizedOfferDetailsSingularEligibility(std::optional<Value> v) {
        set(&Fields::hvLocalizedOfferDetailsSingularEligibility, std::move(v));
    }
    void setHvOfferDisplay(bool v) { set(&Fields::hvOfferDisplay, v); }
    void setHvOfferSettingsAppBadge(bool v) { set(&Fields::hvOfferSettingsAppBadge, v); }
    void setHvOfferSettingsRowBadge(bool v) { set(&Fields::hvOfferSettingsRowBadge, v); }
    void setHvOfferDurationBeforeEndDate(double v) {
        set(&Fields::hvOfferDurationBeforeEndDate, v);
    }
    void setHvOfferToggle(std::optional<Value> v) { set(&Fields::hvOfferToggle, std::move(v)); }
    void setHvOfferPromoFormat(std::optional<Value> v) {
        set(&Fields::hvOfferPromoFormat, std::move(v));
    }
    void setHvOfferPromoNew(std::optional<Value> v) { set(&Fields::hvOfferPromoNew, std::move(v)); }
    void setHvOfferBadgeDurationBeforeEndDate(double v) {
        set(&Fields::hvOfferBadgeDurationBeforeEndDate, v);
    }
    void setCoverageHasHVLogo(bool v) { set(&Fields::coverageHasHVLogo, v); }
    void setLocalizedCoverageSubTitleForServicesPartnerString(std::optional<Value> v) {
        set(&Fields::localizedCoverageSubTitleForServicesPartnerString, std::move(v));
    }
    void setLocalizedCoverageFooterFormatString(std::optional<Value> v) {
        set(&Fields::localizedCoverageFooterFormatString, std::move(v));
    }
    void setLocalizedCoverageFooterLinkLabel(std::optional<Value> v) {
        set(&Fields::localizedCoverageFooterLinkLabel, std::move(v));
    }
    void setLocalizedSupportAppLabel(std::optional<Value> v) {
        set(&Fields::localizedSupportAppLabel, std::move(v));
    }
    void setLocalizedSupportAppFooter(std::optional<Value> v) {
        set(&Fields::localizedSupportAppFooter, std::move(v));
    }
    void setIsCoveragePlanSubscriptionType(bool v) {
        set(&Fields::isCoveragePlanSubscriptionType, v);
    }
    void setLocalizedManagePlanLabel(std::optional<Value> v) {
        set(&Fields::localizedManagePlanLabel, std::move(v));
    }
    void setHvOfferBadgeDaysBeforeEndDate(std::optional<Value> v) {
        set(&Fields::hvOfferBadgeDaysBeforeEndDate, std::move(v));
    }
    void setIsHVServicesPartner(bool v) { set(&Fields::isHVServicesPartner, v); }
    void setHvOfferConversionDate(std::optional<Date> v) { set(&Fields::hvOfferConversionDate, v); }
    void setCoverageDetailsDictionary(std::optional<Value> v) {
        set(&Fields::coverageDetailsDictionary, std::move(v));
    }
    void setLocalizedCoverageDetailsTitle(std::optional<Value> v) {
        set(&Fields::localizedCoverageDetailsTitle, std::move(v));
    }
    void setCoverageDetailsArray(std::optional<Value> v) {
        set(&Fields::coverageDetailsArray, std::move(v));
    }
    void setLocalizedCoverageDetailsLabel(std::optional<Value> v) {
        set(&Fields::localizedCoverageDetailsLabel, std::move(v));
    }
    void setLocalizedCoverageDetailsValue(std::optional<Value> v) {
        set(&Fields::localizedCoverageDetailsValue, std::move(v));
    }
    void setCoverageBenefitsDictionary(std::optional<Value> v) {
        set(&Fields::coverageBenefitsDictionary, std::move(v));
    }
    void setLocalizedBenefitsCardTitle(std::optional<Value> v) {
        set(&Fields::localizedBenefitsCardTitle, std::move(v));
    }
    void setLocalizedBenefitsCardSubTitle(std::optional<Value> v) {
        set(&Fields::localizedBenefitsCardSubTitle, std::move(v));
    }
    void setBenefitDetailsArray(std::optional<Value> v) {
        set(&Fields::benefitDetailsArray, std::move(v));
    }
    void setLocalizedBenefitLabelKey(std::optional<Value> v) {
        set(&Fields::localizedBenefitLabelKey, std::move(v));
    }
    void setLocalizedBenefitValueKey(std::optional<Value> v) {
        set(&Fields::localizedBenefitValueKey, std::move(v));
    }
    void setLocalizedBenefitsCardFooter(std::optional<Value> v) {
        set(&Fields::localizedBenefitsCardFooter, std::move(v));
    }
    void setDisplayRepairAndSupport(bool v) { set(&Fields::displayRepairAndSupport, v); }
    void setAgsURL(std::optional<Value> v) { set(&Fields::agsURL, std::move(v)); }
    void setSupportAppURL(std::optional<Value> v) { set(&Fields::supportAppURL, std::move(v)); }
    void setSerialNumber(std::optional<std::string> v) { set(&Fields::serialNumber, std::move(v)); }
    void setShowNotificationToggle(bool v) { set(&Fields::showNotificationToggle, v); }
    void setShowNotificationBeforeEndDate(double v) {
        set(&Fields::showNotificationBeforeEndDate, v);
    }

    // Derived on every read from the current fields, clock, preferences and locale.
    // Whole days left to buy the plan, rounded up; 0 when the offer has ended or has no end.
    std::uint32_t daysEligible() const;
    std::optional<std::string> hvLocalizedOfferDesc() const;
    std::optional<std::string> hvLocalizedNotificationOfferDesc() const;
    std::optional<std::string> hvLocalizedOfferDetailsEligibility() const;

    // The text of the summary dictionary.
    std::string description() const;
    // Equal summaries make equal records; for anything else, identity.
    bool isEqual(const QAXWarranty* other) const;

    // The archive that crosses IPC: {"$class": "QAXWarranty", "DictionaryRepresentation": {...}}.
    Value encode() const;
    // Rebuilds a record from its archive; none unless the archive names this class and its
    // summary holds only dictionaries, arrays, strings, numbers (and booleans) and dates.
    static std::shared_ptr<QAXWarranty> decode(std::shared_ptr<Platform> platform,
                                               const Value& archive);
    static constexpr bool supportsSecureCoding() { return true; }

    // The per-device cache on disk (defined with the cache). False, with an error logged, when
    // the file could not be written; the previous file then stays.
    bool cacheWarranty(const std::optional<std::string>& serialNumber) const;
    bool cache() const;
    static std::shared_ptr<QAXWarranty> cachedWarrantyForSerialNumber(
        std::shared_ptr<Platform> platform, const std::optional<std::string>& serialNumber);
    static std::shared_ptr<QAXWarranty> migrateLegacyCachedWarrantyIfNeededForSerialNumber(
        std::shared_ptr<Platform> platform, const std::string& serialNumber);
    static std::string _legacyWarrantyPath(const Platform& platform);
    static std::string _warrantyPathForSerialNumberFormat(const Platform& platform);

  private:
    // A field taken from the record's dictionary points into it (the dictionary is shared and
    // never changes while the record lives); a setter gives the field a value of its own.
    // Records are built on every request from cached files, and copying each field out of the
    // dictionary was most of that work.
    class ValueField {
      public:
        ValueField() = default;
        explicit ValueField(const Value* borrowed) : borrowed_(borrowed) {}
        ValueField(std::optional<Value> owned) : owned_(std::move(owned)) {}
        std::optional<Value> value() const {
            return borrowed_ ? std::optional<Value>(*borrowed_) : owned_;
        }

      private:
        std::optional<Value> owned_;
        const Value* borrowed_ = nullptr;
    };

    struct Fields {
        bool covered = false;
        std::optional<Date> coverageEndDate;
        std::optional<Date> coverageValidityDate;
        ValueField localizedCoveredDeviceDateLabelFormat;
        ValueField coverageLocalizedLabel;
        ValueField coverageLocalizedDesc;
        ValueField coverageLocalizedDescLong;
        ValueField coverageLocalizedExpirationLabel;
        ValueField footer1FormatString;
        ValueField footer1LinkLabel;
        ValueField footer1LinkURL;
        ValueField footer2FormatString;
        ValueField footer2LinkLabel;
        ValueField footer2LinkURL;
        bool hvOfferEligible = false;
        std::optional<Date> hvOfferEligibleUntil;
        std::optional<Date> hvOfferFollowupDisplayDate;
        std::optional<Date> hvOfferDisplayDate;
        ValueField hvOfferIdentifier;
        ValueField hvLocalizedOfferLabel;
        ValueField hvLocalizedOfferPluralDescFormat;
        ValueField hvLocalizedOfferSingularDesc;
        ValueField hvNotificationLocalizedOfferLabel;
        ValueField hvNotificationLocalizedOfferSingularDesc;
        ValueField hvNotificationLocalizedOfferPluralDescFormat;
        ValueField hvLocalizedOfferCTA;
        ValueField hvLocalizedOfferDetails;
        ValueField hvLocalizedOfferDetailsPluralEligibilityFormat;
        ValueField hvLocalizedOfferDetailsSingularEligibility;
        bool hvOfferDisplay = false;
        bool hvOfferSettingsAppBadge = false;
        bool hvOfferSettingsRowBadge = false;
        double hvOfferDurationBeforeEndDate = 0;
        ValueField hvOfferToggle;
        ValueField hvOfferPromoFormat;
        ValueField hvOfferPromoNew;
        double hvOfferBadgeDurationBeforeEndDate = 0;
        bool coverageHasHVLogo = false;
        ValueField localizedCoverageSubTitleForServicesPartnerString;
        ValueField localizedCoverageFooterFormatString;
        ValueField localizedCoverageFooterLinkLabel;
        ValueField localizedSupportAppLabel;
        ValueField localizedSupportAppFooter;
        bool isCoveragePlanSubscriptionType = false;
        ValueField localizedManagePlanLabel;
        ValueField hvOfferBadgeDaysBeforeEndDate;
        bool isHVServicesPartner = false;
        std::optional<Date> hvOfferConversionDate;
        ValueField coverageDetailsDictionary;
        ValueField localizedCoverageDetailsTitle;
        ValueField coverageDetailsArray;
        ValueField localizedCoverageDetailsLabel;
        ValueField localizedCoverageDetailsValue;
        ValueField coverageBenefitsDictionary;
        ValueField localizedBenefitsCardTitle;
        ValueField localizedBenefitsCardSubTitle;
        ValueField benefitDetailsArray;
        ValueField localizedBenefitLabelKey;
        ValueField localizedBenefitValueKey;
        ValueField localizedBenefitsCardFooter;
        bool displayRepairAndSupport = false;
        ValueField agsURL;
        ValueField supportAppURL;
        std::optional<std::string> serialNumber;
        bool showNotificationToggle = false;
        double showNotificationBeforeEndDate = 0;
    };

    template <typename T>
    T get(T Fields::*field) const {
        std::lock_guard<std::mutex> lock(mutex_);
        return fields_.*field;
    }
    std::optional<Value> get(ValueField Fields::*field) const {
        std::lock_guard<std::mutex> lock(mutex_);
        return (fields_.*field).value();
    }
    template <typename T, typename U>
    void set(T Fields::*field, U&& value) {
        std::lock_guard<std::mutex> lock(mutex_);
        fields_.*field = std::forward<U>(value);
    }

    std::optional<Date> conversionDate(const Value& dictionary,
                                       std::optional<Date> coverageEndDate) const;
    std::optional<std::string> offerText(std::optional<Value> pluralFormat,
                                         std::optional<Value> singular,
                                         const char* notAStringMessage) const;

    const std::shared_ptr<Platform> platform_;
    const std::shared_ptr<const Value> dictionary_;
    mutable std::mutex mutex_;
    Fields fields_;
};

}  // namespace qax
