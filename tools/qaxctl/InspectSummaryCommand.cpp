// qaxctl inspect-summary: shows the warranty record the agent would build from a coverage
// summary file (JSON or a property list), read with the agent's own preference domain,
// clock and locale, so that an engineer sees the derived day count and offer texts the
// device would show today.
#include <nlohmann/json.hpp>

#include <cstdio>
#include <fstream>
#include <functional>
#include <iostream>
#include <string>
#include <vector>

#include "Command.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "platform/Platform.h"
#include "platform/QAXSettings.h"
#include "platform/host/HostPlatform.h"
#include "warranty/QAXWarranty.h"

namespace qaxctl {
namespace {

using qax::QAXWarranty;
using qax::Value;

constexpr const char* kUsage = "usage: qaxctl inspect-summary FILE [--json]\n";
constexpr std::size_t kMaxSummaryBytes = 16 * 1024 * 1024;

// One line of the report: a field's name and its value (none when absent).
struct Field {
    const char* name;
    std::function<std::optional<Value>(const QAXWarranty&)> read;
};

template <typename T>
std::optional<Value> present(const std::optional<T>& v) {
    return v ? std::optional<Value>(Value(*v)) : std::nullopt;
}

// The record's fields in their declared order, then the derived values.
const std::vector<Field>& fields() {
    using W = QAXWarranty;
    static const std::vector<Field> list = {
        {"covered", [](const W& w) { return Value(w.covered()); }},
        {"coverageEndDate", [](const W& w) { return present(w.coverageEndDate()); }},
        {"coverageValidityDate", [](const W& w) { return present(w.coverageValidityDate()); }},
        {"localizedCoveredDeviceDateLabelFormat",
         [](const W& w) { return w.localizedCoveredDeviceDateLabelFormat(); }},
        {"coverageLocalizedLabel", [](const W& w) { return w.coverageLocalizedLabel(); }},
        {"coverageLocalizedDesc", [](const W& w) { return w.coverageLocalizedDesc(); }},
        {"coverageLocalizedDescLong", [](const W& w) { return w.coverageLocalizedDescLong(); }},
        {"coverageLocalizedExpirationLabel",
         [](const W& w) { return w.coverageLocalizedExpirationLabel(); }},
        {"footer1FormatString", [](const W& w) { return w.footer1FormatString(); }},
        {"footer1LinkLabel", [](const W& w) { return w.footer1LinkLabel(); }},
        {"footer1LinkURL", [](const W& w) { return w.footer1LinkURL(); }},
        {"footer2FormatString", [](const W& w) { return w.footer2FormatString(); }},
        {"footer2LinkLabel", [](const W& w) { return w.footer2LinkLabel(); }},
        {"footer2LinkURL", [](const W& w) { return w.footer2LinkURL(); }},
        {"hvOfferEligible", [](const W& w) { return Value(w.hvOfferEligible()); }},
        {"hvOfferEligibleUntil", [](const W& w) { return present(w.hvOfferEligibleUntil()); }},
        {"hvOfferFollowupDisplayDate",
         [](const W& w) { return present(w.hvOfferFollowupDisplayDate()); }},
        {"hvOfferDisplayDate", [](const W& w) { return present(w.hvOfferDisplayDate()); }},
        {"hvOfferIdentifier", [](const W& w) { return w.hvOfferIdentifier(); }},
        {"hvLocalizedOfferLabel", [](const W& w) { return w.hvLocalizedOfferLabel(); }},
        {"hvLocalizedOfferPluralDescFormat",
         [](const W& w) { return w.hvLocalizedOfferPluralDescFormat(); }},
        {"hvLocalizedOfferSingularDesc",
         [](const W& w) { return w.hvLocalizedOfferSingularDesc(); }},
        {"hvNotificationLocalizedOfferLabel",
         [](const W& w) { return w.hvNotificationLocalizedOfferLabel(); }},
        {"hvNotificationLocalizedOfferSingularDesc",
         [](const W& w) { return w.hvNotificationLocalizedOfferSingularDesc(); }},
        {"hvNotificationLocalizedOfferPluralDescFormat",
         [](const W& w) { return w.hvNotificationLocalizedOfferPluralDescFormat(); }},
        {"hvLocalizedOfferCTA", [](const W& w) { return w.hvLocalizedOfferCTA(); }},
        {"hvLocalizedOfferDetails", [](const W& w) { return w.hvLocalizedOfferDetails(); }},
        {"hvLocalizedOfferDetailsPluralEligibilityFormat",
         [](const W& w) { return w.hvLocalizedOfferDetailsPluralEligibilityFormat(); }},
        {"hvLocalizedOfferDetailsSingularEligibility",
         [](const W& w) { return w.hvLocalizedOfferDetailsSingularEligibility(); }},
        {"hvOfferDisplay", [](const W& w) { return Value(w.hvOfferDisplay()); }},
        {"hvOfferSettingsAppBadge", [](const W& w) { return Value(w.hvOfferSettingsAppBadge()); }},
        {"hvOfferSettingsRowBadge", [](const W& w) { return Value(w.hvOfferSettingsRowBadge()); }},
        {"hvOfferDurationBeforeEndDate",
         [](const W& w) { return Value(w.hvOfferDurationBeforeEndDate()); }},
        {"hvOfferToggle", [](const W& w) { return w.hvOfferToggle(); }},
        {"hvOfferPromoFormat", [](const W& w) { return w.hvOfferPromoFormat(); }},
        {"hvOfferPromoNew", [](const W& w) { return w.hvOfferPromoNew(); }},
        {"hvOfferBadgeDurationBeforeEndDate",
         [](const W& w) { return Value(w.hvOfferBadgeDurationBeforeEndDate()); }},
        {"coverageHasHVLogo", [](const W& w) { return Value(w.coverageHasHVLogo()); }},
        {"localizedCoverageSubTitleForServicesPartnerString",
         [](const W& w) { return w.localizedCoverageSubTitleForServicesPartnerString(); }},
        {"localizedCoverageFooterFormatString",
         [](const W& w) { return w.localizedCoverageFooterFormatString(); }},
        {"localizedCoverageFooterLinkLabel",
         [](const W& w) { return w.localizedCoverageFooterLinkLabel(); }},
        {"localizedSupportAppLabel", [](const W& w) { return w.localizedSupportAppLabel(); }},
        {"localizedSupportAppFooter", [](const W& w) { return w.localizedSupportAppFooter(); }},
        {"isCoveragePlanSubscriptionType",
         [](const W& w) { return Value(w.isCoveragePlanSubscriptionType()); }},
        {"localizedManagePlanLabel", [](const W& w) { return w.localizedManagePlanLabel(); }},
        {"hvOfferBadgeDaysBeforeEndDate",
         [](const W& w) { return w.hvOfferBadgeDaysBeforeEndDate(); }},
        {"isHVServicesPartner", [](const W& w) { return Value(w.isHVServicesPartner()); }},
        {"hvOfferConversionDate", [](const W& w) { return present(w.hvOfferConversionDate()); }},
        {"coverageDetailsDictionary", [](const W& w) { return w.coverageDetailsDictionary(); }},
        {"localizedCoverageDetailsTitle",
         [](const W& w) { return w.localizedCoverageDetailsTitle(); }},
        {"coverageDetailsArray", [](const W& w) { return w.coverageDetailsArray(); }},
        {"localizedCoverageDetailsLabel",
         [](const W& w) { return w.localizedCoverageDetailsLabel(); }},
        {"localizedCoverageDetailsValue",
         [](const W& w) { return w.localizedCoverageDetailsValue(); }},
        {"coverageBenefitsDictionary", [](const W& w) { return w.coverageBenefitsDictionary(); }},
        {"localizedBenefitsCardTitle", [](const W& w) { return w.localizedBenefitsCardTitle(); }},
        {"localizedBenefitsCardSubTitle",
         [](const W& w) { return w.localizedBenefitsCardSubTitle(); }},
        {"benefitDetailsArray", [](const W& w) { return w.benefitDetailsArray(); }},
        {"localizedBenefitLabelKey", [](const W& w) { return w.localizedBenefitLabelKey(); }},
        {"localizedBenefitValueKey", [](const W& w) { return w.localizedBenefitValueKey(); }},
        {"localizedBenefitsCardFooter", [](const W& w) { return w.localizedBenefitsCardFooter(); }},
        {"displayRepairAndSupport", [](const W& w) { return Value(w.displayRepairAndSupport()); }},
        {"agsURL", [](const W& w) { return w.agsURL(); }},
        {"supportAppURL", [](const W& w) { return w.supportAppURL(); }},
        {"dictionaryRepresentation",
         [](const W& w) { return std::optional<Value>(w.dictionaryRepresentation()); }},
        {"serialNumber", [](const W& w) { return present(w.serialNumber()); }},
        {"showNotificationToggle", [](const W& w) { return Value(w.showNotificationToggle()); }},
        {"showNotificationBeforeEndDate",
         [](const W& w) { return Value(w.showNotificationBeforeEndDate()); }},
        {"hvLocalizedOfferDesc", [](const W& w) { return present(w.hvLocalizedOfferDesc()); }},
        {"hvLocalizedNotificationOfferDesc",
         [](const W& w) { return present(w.hvLocalizedNotificationOfferDesc()); }},
        {"hvLocalizedOfferDetailsEligibility",
         [](const W& w) { return present(w.hvLocalizedOfferDetailsEligibility()); }},
        {"daysEligible",
         [](const W& w) { return Value(static_cast<long long>(w.daysEligible())); }},
    };
    return list;
}

bool looksLikePlist(const std::string& bytes) {
    if (qax::isBinaryPlist(bytes)) {
        return true;
    }
    const auto start = bytes.find_first_not_of(" \t\r\n");
    return start != std::string::npos && bytes[start] == '<';
}

// The summary as a dictionary, or a reason on stderr and none.
std::optional<Value> readSummary(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    if (!in) {
        std::fprintf(stderr, "qaxctl inspect-summary: cannot open '%s'\n", path.c_str());
        return std::nullopt;
    }
    std::string bytes(kMaxSummaryBytes + 1, '\0');
    in.read(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    bytes.resize(static_cast<std::size_t>(in.gcount()));
    if (bytes.size() > kMaxSummaryBytes) {
        std::fprintf(stderr, "qaxctl inspect-summary: '%s' is larger than %zu bytes\n",
                     path.c_str(), kMaxSummaryBytes);
        return std::nullopt;
    }
    std::string error;
    const bool plist = looksLikePlist(bytes);
    auto summary = plist ? qax::parsePlist(bytes, &error) : qax::parseJson(bytes, &error);
    if (!summary) {
        std::fprintf(stderr, "qaxctl inspect-summary: '%s' is not valid %s: %s\n", path.c_str(),
                     plist ? "property list" : "JSON", error.c_str());
        return std::nullopt;
    }
    if (!summary->isDictionary()) {
        std::fprintf(stderr,
                     "qaxctl inspect-summary: '%s' holds %s, not a coverage summary dictionary\n",
                     path.c_str(), Value::kindName(summary->kind()));
        return std::nullopt;
    }
    return summary;
}

void printText(const QAXWarranty& warranty) {
    for (const auto& field : fields()) {
        auto value = field.read(warranty);
        std::string text = "(null)";
        if (value && value->isBool()) {
            text = value->truthy() ? "true" : "false";
        } else if (value) {
            text = value->description();
        }
        std::cout << field.name << ": " << text << '\n';
    }
}

void printJson(const QAXWarranty& warranty) {
    auto out = nlohmann::ordered_json::object();
    for (const auto& field : fields()) {
        auto value = field.read(warranty);
        if (!value) {
            out[field.name] = nullptr;
        } else if (auto date = value->asDate()) {
            out[field.name] = date->iso8601();
        } else {
            out[field.name] = qax::jsonFromValue(*value);
        }
    }
    std::cout << out.dump(2) << '\n';
}

int run(const std::vector<std::string>& arguments) {
    std::vector<std::string> args = arguments;
    const bool json = takeFlag(args, "--json");
    if (args.size() != 1) {
        std::fputs(kUsage, stderr);
        return 1;
    }
    auto summary = readSummary(args[0]);
    if (!summary) {
        return 1;
    }
    auto platform = qax::makeHostPlatform(qax::HostEnvironment::fromProcessEnvironment(), nullptr);
    qax::qax_registerDefaults(*platform->preferences);
    auto warranty = QAXWarranty::initWithDictionary(platform, summary);
    if (!warranty) {
        std::fprintf(stderr, "qaxctl inspect-summary: no warranty record could be built\n");
        return 1;
    }
    if (json) {
        printJson(*warranty);
    } else {
        printText(*warranty);
    }
    return 0;
}

QAXCTL_COMMAND("inspect-summary", "inspect-summary FILE [--json]",
               "show the warranty record the agent builds from a coverage summary", run);

}  // namespace
}  // namespace qaxctl
