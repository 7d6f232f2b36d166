// A point in time as seconds since 1970-01-01 00:00:00 UTC (a double), with the
// arithmetic the agent does in seconds. Immutable value type; any thread.
#pragma once

#include <compare>
#include <optional>
#include <string>
#include <string_view>

namespace qax {

// Seconds between 1970-01-01 and 2001-01-01, the reference date of property-list dates.
inline constexpr double kSecondsFrom1970To2001 = 978307200.0;

class Date {
  public:
    constexpr Date() = default;
    constexpr explicit Date(double secondsSince1970) : seconds_(secondsSince1970) {}

    static constexpr Date fromSecondsSince1970(double s) { return Date(s); }
    constexpr double secondsSince1970() const { return seconds_; }

    constexpr Date byAdding(double seconds) const { return Date(seconds_ + seconds); }
    // Seconds from `other` to this date (positive when this date is later).
    constexpr double timeIntervalSince(Date other) const { return seconds_ - other.seconds_; }

    constexpr auto operator<=>(const Date&) const = default;

    // "2023-11-14 22:13:20 +0000", the printed form of a date in logs and descriptions.
    std::string description() const;
    // "2023-11-14T22:13:20.000Z": ISO 8601 in UTC with milliseconds.
    std::string iso8601() const;
    // Parses ISO 8601 date-times: "2023-11-14", "2023-11-14T22:13:20Z",
    // "2023-11-14T22:13:20.5+01:00". No value when the text is not such a date.
    static std::optional<Date> parseIso8601(std::string_view text);

  private:
    double seconds_ = 0;
};

}  // namespace qax
