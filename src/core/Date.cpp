#include "core/Date.h"

#include <cmath>
#include <cstdio>
#include <ctime>

namespace qax {
namespace {

bool breakDown(double seconds, std::tm& out, int& millis) {
    double whole = std::floor(seconds);
    if (!std::isfinite(whole) || whole < -62135596800.0 || whole > 253402300799.0) {
        return false;
    }
    millis = static_cast<int>(std::llround((seconds - whole) * 1000.0));
    if (millis >= 1000) {
        millis -= 1000;
        whole += 1;
    }
    std::time_t t = static_cast<std::time_t>(whole);
    return gmtime_r(&t, &out) != nullptr;
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
    std::tm tm{};
    int millis = 0;
    if (!breakDown(seconds_, tm, millis)) {
        return std::to_string(seconds_);
    }
    char buf[64];
    std::snprintf(buf, sizeof buf, "%04d-%02d-%02d %02d:%02d:%02d +0000", tm.tm_year + 1900,
                  tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec);
    return buf;
}

std::string Date::iso8601() const {
    std::tm tm{};
    int millis = 0;
    if (!breakDown(seconds_, tm, millis)) {
        return std::to_string(seconds_);
    }
    char buf[64];
    std::snprintf(buf, sizeof buf, "%04d-%02d-%02dT%02d:%02d:%02d.%03dZ", tm.tm_year + 1900,
                  tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, millis);
    return buf;
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
