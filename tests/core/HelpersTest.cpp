#include <gtest/gtest.h>

#include <cstdio>
#include <ctime>
#include <string>
#include <thread>
#include <vector>

#include "core/Base64.h"
#include "core/Date.h"
#include "core/Hash.h"
#include "core/VersionCompare.h"

namespace qax {
namespace {

TEST(VersionCompare, DigitRunsCompareNumerically) {
    const std::tuple<const char*, const char*, int> rows[] = {
        {"4.10", "4.9", 1},  {"4.9", "4.10", -1},    {"4.2", "4.2", 0},
        {"4.2.1", "4.2", 1}, {"4.2", "4.2.1", -1},   {"10.0", "9.9.9", 1},
        {"4.02", "4.2", 0},  {"4.2b", "4.2a", 1},    {"", "", 0},
        {"1", "", 1},        {"12A345", "12A99", 1}, {"99999999999999999999", "1", 1},
    };
    for (const auto& [a, b, sign] : rows) {
        int c = compareVersions(a, b);
        EXPECT_EQ((c > 0) - (c < 0), sign) << a << " vs " << b;
        EXPECT_EQ(isVersionGreater(a, b), sign > 0) << a << " vs " << b;
    }
}

TEST(Sha256Hash, KnownDigests) {
    const std::pair<std::string, const char*> rows[] = {
        {"", "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855"},
        {"abc", "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"},
        // Only the bytes before the first zero byte count.
        {std::string("abc\0def", 7),
         "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"},
    };
    // Hashes are remembered per thread: asked again, after others pushed them out, and from
    // another thread, the answers stay the same.
    for (int pass = 0; pass < 3; ++pass) {
        for (const auto& [input, hex] : rows) {
            EXPECT_EQ(sha256Hash(input), hex) << pass;
        }
        for (int i = 0; i < 2 * pass * 9; ++i) {
            EXPECT_EQ(sha256Hash("C02TESTSERIAL" + std::to_string(i % 9)).size(), 64u);
        }
    }
    std::thread([&] { EXPECT_EQ(sha256Hash(rows[1].first), rows[1].second); }).join();
}

TEST(Base64, RoundTripsWithPaddingAndNoLineBreaks) {
    const std::pair<std::string, const char*> rows[] = {
        {"", ""}, {"f", "Zg=="}, {"fo", "Zm8="}, {"foo", "Zm9v"}, {"foob", "Zm9vYg=="}};
    for (const auto& [raw, encoded] : rows) {
        EXPECT_EQ(base64Encode(raw), encoded);
        auto back = base64Decode(encoded);
        ASSERT_TRUE(back);
        EXPECT_EQ(std::string(back->begin(), back->end()), raw);
    }
    std::string big(1000, 'x');
    EXPECT_EQ(base64Encode(big).find('\n'), std::string::npos);
    EXPECT_FALSE(base64Decode("abc"));
    EXPECT_FALSE(base64Decode("a*b="));
}

TEST(DateFormats, Iso8601ParseAndPrint) {
    const std::pair<const char*, double> rows[] = {
        {"2023-11-14T22:13:20Z", 1700000000},
        {"2023-11-14T22:13:20.500Z", 1700000000.5},
        {"2023-11-14T23:13:20+01:00", 1700000000},
        {"2023-11-14T21:43:20-0030", 1700000000},
        {"1970-01-01", 0},
        {"2286-11-20T17:46:40Z", 10000000000},
    };
    for (const auto& [text, seconds] : rows) {
        auto d = Date::parseIso8601(text);
        ASSERT_TRUE(d) << text;
        EXPECT_DOUBLE_EQ(d->secondsSince1970(), seconds) << text;
    }
    for (const char* bad :
         {"", "yesterday", "2023-13-01", "2023-11-14T25:00:00Z", "2023-11-14Tx"}) {
        EXPECT_FALSE(Date::parseIso8601(bad)) << bad;
    }
    EXPECT_EQ(Date(1700000000).iso8601(), "2023-11-14T22:13:20.000Z");
    EXPECT_EQ(Date(1700000000.9999).iso8601(), "2023-11-14T22:13:21.000Z");

    // Both printed forms agree with the C library's calendar from year 1 to 9999, leap days,
    // negative times and the last second of a day included.
    std::vector<std::int64_t> times{-62135596800, -86401,    -1,         0,
                                    951782400,    951868799, 4107542399, 253402300799};
    for (std::int64_t t = -62135596800; t < 253402300799; t += 86400LL * 365 * 7 + 9977) {
        times.push_back(t);
    }
    for (std::int64_t t : times) {
        const std::time_t tt = t;
        std::tm tm{};
        ASSERT_TRUE(gmtime_r(&tt, &tm));
        char expected[64];
        std::snprintf(expected, sizeof expected, "%04d-%02d-%02d %02d:%02d:%02d", tm.tm_year + 1900,
                      tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec);
        ASSERT_EQ(Date(static_cast<double>(t)).description(), expected + std::string(" +0000"))
            << t;
        expected[10] = 'T';
        ASSERT_EQ(Date(static_cast<double>(t) + 0.25).iso8601(), expected + std::string(".250Z"))
            << t;
    }
}

}  // namespace
}  // namespace qax
