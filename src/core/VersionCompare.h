// Comparison of system version strings such as "4.10" and "4.9.1". Stateless.
#pragma once

#include <string_view>

namespace qax {

// Runs of digits compare by numeric value ("4.10" > "4.9"); other characters compare one by
// one. Returns a negative number, 0 or a positive number.
int compareVersions(std::string_view a, std::string_view b);

// True only when `a` is strictly greater than `b`; equal strings are not greater.
inline bool isVersionGreater(std::string_view a, std::string_view b) {
    return compareVersions(a, b) > 0;
}

}  // namespace qax
