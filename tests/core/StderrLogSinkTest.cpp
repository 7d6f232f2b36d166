#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdio>

#include "core/Log.h"

namespace qax {
namespace {

TEST(StderrLogSinkTest, JournalLinesCarryThePriorityOfTheirLevelInsteadOfTheTime) {
    const std::tuple<LogLevel, bool, const char*> rows[] = {
        {LogLevel::Error, true, "<3>error com.velmora.Kestova:core text\n"},
        {LogLevel::Default, true, "<6>default com.velmora.Kestova:core text\n"},
        {LogLevel::Debug, true, "<7>debug com.velmora.Kestova:core text\n"},
        {LogLevel::Error, false, "2030-01-02 03:04:05.678 error com.velmora.Kestova:core text\n"},
    };
    for (const auto& [level, journal, expected] : rows) {
        EXPECT_EQ(StderrLogSink::formatLine(level, kLogSubsystem, kLogCategory, "text",
                                            "2030-01-02 03:04:05.678", journal),
                  expected);
    }
}

TEST(StderrLogSinkTest, OnlyTheStreamJournalStreamNamesIsTheJournal) {
    std::FILE* file = std::tmpfile();
    ASSERT_NE(file, nullptr);
    struct stat st {};
    ASSERT_EQ(::fstat(fileno(file), &st), 0);
    const std::string self = std::to_string(st.st_dev) + ":" + std::to_string(st.st_ino);
    const std::string other = std::to_string(st.st_dev) + ":" + std::to_string(st.st_ino + 1);
    const std::string trailing = self + "x";
    const std::pair<const char*, bool> rows[] = {
        {self.c_str(), true},
        {other.c_str(), false},  // inherited by a process whose stderr was redirected
        {nullptr, false},
        {trailing.c_str(), false},
    };
    for (const auto& [value, journal] : rows) {
        EXPECT_EQ(StderrLogSink::isJournalStream(value, fileno(file)), journal)
            << (value ? value : "(unset)");
    }
    std::fclose(file);
}

}  // namespace
}  // namespace qax
