#include "core/Date.h"

#include <cmath>
#include <cstdio>
#include <cstring>

namespace qax {
namespace {

// The calendar fields of a time in UTC (proleptic Gregorian calendar).
struct Civil {
    long long year;
    unsigned month, day, hour, minute, second, millis;
};

// Dates are printed in every log line that names a device, so this is done with arithmetic
// rather than gmtime_r() (a lock) and snprintf().
bool breakDown(double seconds, Civil& out) {
    double whole = std::floor(seconds);
    if (!std::isfinite(whole) || whole < -62135596800.0 || whole > 253402300799.0) {
        return false;
    }
    auto millis = static_cast<unsigned>(std::llround((seconds - whole) * 1000.0));
    if (millis >= 1000) {
        millis -= 1000;
        whole += 1;
    }
    const auto t = static_cast<long long>(whole);
    long long days = t / 86400;
    long long rest = t % 86400;
    if (rest < 0) {
        rest += 86400;
        --days;
    }
    // Civil date from days since 1970-01-01 (Howard Hinnant's algorithm).
    days += 719468;
    const long long era = (days >= 0 ? days : days - 146096) / 146097;
    const auto doe = static_cast<unsigned>(days - era * 146097);
    const unsigned yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
    const unsigned doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
    const unsigned mp = (5 * doy + 2) / 153;
    out.day = doy - (153 * mp + 2) / 5 + 1;
    out.month = mp < 10 ? mp + 3 : mp - 9;
    out.year = static_cast<long long>(yoe) + era * 400 + (out.month <= 2);
    out.hour = static_cast<unsigned>(rest / 3600);
    out.minute = static_cast<unsigned>(rest / 60 % 60);
    out.second = static_cast<unsigned>(rest % 60);
    out.millis = millis;
    return true;
}

// Writes `value` as exactly `width` decimal digits.
char* digits(char* p, unsigned value, int width) {
    for (int i = width - 1; i >= 0; --i) {
        p[i] = static_cast<char>('0' + value % 10);
        value /= 10;
    }
    return p + width;
}

// "YYYY-MM-DD?hh:mm:ss" with `separator` between date and time; returns the end.
char* writeCivil(char* p, const Civil& c, char separator) {
    p = digits(p, static_cast<unsigned>(c.year), 4);
    *p++ = '-';
    p = digits(p, c.month, 2);
    *p++ = '-';
    p = digits(p, c.day, 2);
    *p++ = separator;
    p = digits(p, c.hour, 2);
    *p++ = ':';
    p = digits(p, c.minute, 2);
    *p++ = ':';
    return digits(p, c.second, 2);
}

// Days since 1970-01-01 of a civil date (proleptic Gregorian calendar).
long long daysFromCivil(long long y, unsigned m, unsigned d) {
    y -= m <= 2;
    const long long era = (y >= 0 ? y : y - 399) / 400;
    const unsigned yoe = static_cast<unsigned>(y - era * 400);
    const unsigned doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
    const unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    return era * 146097 + static_cast<long long>(doe) - 719468;
}

}  // namespace

std::string Date::description() const {
    Civil c{};
    if (!breakDown(seconds_, c)) {
        return std::to_string(seconds_);
    }
    char buf[32];
    char* end = writeCivil(buf, c, ' ');
    std::memcpy(end, " +0000", 6);
    return std::string(buf, end + 6);
}

std::string Date::iso8601() const {
    Civil c{};
    if (!breakDown(seconds_, c)) {
        return std::to_string(seconds_);
    }
    char buf[32];
    char* end = writeCivil(buf, c, 'T');
    *end++ = '.';
    end = digits(end, c.millis, 3);
    *end++ = 'Z';
    return std::string(buf, end);
}

std::optional<Date> Date::parseIso8601(std::string_view text) {
    std::string s(text);
    int y = 0, mo = 0, d = 0, h = 0, mi = 0, consumed = 0;
    double sec = 0;
    if (std::sscanf(s.c_str(), "%4d-%2d-%2d%n", &y, &mo, &d, &consumed) != 3 || consumed != 10) {
        return std::nullopt;
    }
    std::size_t pos = 10;
    if (pos < s.size() && (s[pos] == 'T' || s[pos] == ' ')) {
        int n = 0;
        if (std::sscanf(s.c_str() + pos + 1, "%2d:%2d%n", &h, &mi, &n) != 2 || n != 5) {
            return std::nullopt;
        }
        pos += 1 + 5;
        if (pos < s.size() && s[pos] == ':') {
            char* end = nullptr;
            sec = std::strtod(s.c_str() + pos + 1, &end);
            if (end == s.c_str() + pos + 1) {
                return std::nullopt;
            }
            pos = static_cast<std::size_t>(end - s.c_str());
        }
    }
    double offset = 0;
    if (pos < s.size()) {
        if (s[pos] == 'Z' && pos + 1 == s.size()) {
            pos++;
        } else if (s[pos] == '+' || s[pos] == '-') {
            int oh = 0, om = 0, n = 0;
            const char* p = s.c_str() + pos + 1;
            if (std::sscanf(p, "%2d:%2d%n", &oh, &om, &n) == 2 && n == 5) {
            } else if (std::sscanf(p, "%2d%2d%n", &oh, &om, &n) == 2 && n == 4) {
            } else {
                return std::nullopt;
            }
            offset = (oh * 3600.0 + om * 60.0) * (s[pos] == '-' ? -1 : 1);
            pos += 1 + static_cast<std::size_t>(n);
        }
    }
    if (pos != s.size() || mo < 1 || mo > 12 || d < 1 || d > 31 || h > 23 || mi > 59 || sec < 0 ||
        sec >= 61) {
        return std::nullopt;
    }
    double days =
        static_cast<double>(daysFromCivil(y, static_cast<unsigned>(mo), static_cast<unsigned>(d)));
    return Date(days * 86400.0 + h * 3600.0 + mi * 60.0 + sec - offset);
}

}  // namespace qax
