#include <gtest/gtest.h>

#include <memory>
#include <optional>

#include "core/Log.h"

namespace qax {
namespace {

struct Described {
    std::string description() const { return "<QAXDevice Default Device>"; }
};

TEST(LogFormat, EveryDirective) {
    const std::optional<std::string> none;
    struct Row {
        const char* format;
        std::vector<LogArg> args;
        const char* expected;
    } rows[] = {
        {"launched", {}, "launched"},
        {"%@", {toLogArg("text")}, "text"},
        {"%@", {toLogArg(none)}, "(null)"},
        {"%@", {toLogArg(Value(Value::Dictionary{{"a", 1}}))}, "{\n    a = 1;\n}"},
        {"%@", {toLogArg(Described{})}, "<QAXDevice Default Device>"},
        {"%@", {toLogArg(std::make_shared<Described>())}, "<QAXDevice Default Device>"},
        {"%s : %d",
         {toLogArg("+[QAXWarranty warrantyWithDictionary:serialNumber:]"), toLogArg(1)},
         "+[QAXWarranty warrantyWithDictionary:serialNumber:] : 1"},
        {"%{public}s", {toLogArg("public")}, "public"},
        {"'%{private}@' (%{public}d)", {toLogArg("C02SERIAL"), toLogArg(3)}, "'C02SERIAL' (3)"},
        {"%ld and %lu", {toLogArg(-5L), toLogArg(7UL)}, "-5 and 7"},
        {"%d", {toLogArg(true)}, "1"},
        {"%.02f", {toLogArg(3.14159)}, "3.14"},
        {"%f", {toLogArg(3600.0)}, "3600.000000"},
        {"100%% done", {}, "100% done"},
        {" Server lookup policy:%ld", {toLogArg(2)}, " Server lookup policy:2"},
        {"missing %@", {}, "missing (null)"},
        {"trailing %", {}, "trailing %"},
    };
    for (const auto& r : rows) {
        EXPECT_EQ(formatLogMessage(r.format, r.args, true), r.expected) << r.format;
    }
    // Without private logging only the private argument is hidden.
    EXPECT_EQ(formatLogMessage(rows[8].format, rows[8].args, false), "'<private>' (3)");
}

TEST(LogLevels, SinksFilterDebugAndHandleRebinds) {
    StderrLogSink quiet(false, false), verbose(true, false);
    EXPECT_TRUE(quiet.isEnabled(LogLevel::Default));
    EXPECT_TRUE(quiet.isEnabled(LogLevel::Error));
    EXPECT_FALSE(quiet.isEnabled(LogLevel::Debug));
    EXPECT_TRUE(verbose.isEnabled(LogLevel::Debug));

    auto capture = std::make_shared<CapturingLogSink>(false);
    Log log("com.velmora.Kestova", "core", capture);
    log.info("a %{private}@", "secret");
    log.debug("b");
    log.error("c %d", 1);
    auto entries = capture->entries();
    ASSERT_EQ(entries.size(), 3u);
    EXPECT_EQ(entries[0].message, "a <private>");
    EXPECT_EQ(entries[0].level, LogLevel::Default);
    EXPECT_EQ(entries[1].level, LogLevel::Debug);
    EXPECT_EQ(entries[2].level, LogLevel::Error);
    EXPECT_EQ(capture->count("c 1"), 1);

    auto other = std::make_shared<CapturingLogSink>();
    log.setSink(other);
    log.info("after");
    EXPECT_TRUE(other->contains("after"));
    EXPECT_FALSE(capture->contains("after"));
}

}  // namespace
}  // namespace qax
