#include "core/VersionCompare.h"

#include <cctype>

namespace qax {
namespace {

bool isDigit(char c) {
    return std::isdigit(static_cast<unsigned char>(c)) != 0;
}

}  // namespace

int compareVersions(std::string_view a, std::string_view b) {
    std::size_t i = 0, j = 0;
    while (i < a.size() && j < b.size()) {
        if (isDigit(a[i]) && isDigit(b[j])) {
            std::size_t ei = i, ej = j;
            while (ei < a.size() && isDigit(a[ei])) {
                ++ei;
            }
            while (ej < b.size() && isDigit(b[ej])) {
                ++ej;
            }
            // Compare the runs as numbers of any length: strip leading zeros, then the
            // longer run is larger, then the first differing digit decides.
            std::size_t si = i, sj = j;
            while (si + 1 < ei && a[si] == '0') {
                ++si;
            }
            while (sj + 1 < ej && b[sj] == '0') {
                ++sj;
            }
            std::size_t li = ei - si, lj = ej - sj;
            if (li != lj) {
                return li < lj ? -1 : 1;
            }
            for (std::size_t k = 0; k < li; ++k) {
                if (a[si + k] != b[sj + k]) {
                    return a[si + k] < b[sj + k] ? -1 : 1;
                }
            }
            i = ei;
            j = ej;
            continue;
        }
        if (a[i] != b[j]) {
            return static_cast<unsigned char>(a[i]) < static_cast<unsigned char>(b[j]) ? -1 : 1;
        }
        ++i;
        ++j;
    }
    if (i < a.size()) {
        return 1;
    }
    if (j < b.size()) {
        return -1;
    }
    return 0;
}

}  // namespace qax
