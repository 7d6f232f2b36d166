// The launch-event handler: what it logs for each kind of event.
#include <gtest/gtest.h>

#include "agent/QAXLaunchEventHandler.h"
#include "fakes/TestPlatform.h"

namespace qax {
namespace {

TEST(QAXLaunchEventHandlerTest, LogsEachEventByItsName) {
    const std::optional<std::string> cases[] = {
        std::nullopt,
        std::string("\xff\xfe"),
        std::string("com.velmora.pairlink.devicedidpair"),
        std::string("com.velmora.pairlink.devicedidunpair"),
        std::string("com.velmora.language.changed"),
    };
    for (const auto& name : cases) {
        test::TestPlatform env;
        QAXLaunchEventHandler().handleEvent(LaunchEvent(name));
        std::vector<std::string> logged = {"entered stream for test"};
        if (name && QAXLaunchEventHandler::isValidUTF8(*name)) {
            logged.push_back("got launched with notificationName: " + *name);
        } else if (name) {
            logged.push_back("notificationName is nil");
        }
        EXPECT_EQ(env.log->messages(), logged) << name.value_or("(none)");
    }
}

TEST(QAXLaunchEventHandlerTest, Utf8Validation) {
    const std::pair<std::string, bool> cases[] = {
        {"", true},
        {"plain.ascii", true},
        {"caf\xc3\xa9", true},
        {"\xe2\x82\xac", true},       // euro sign
        {"\xf0\x9f\x98\x80", true},   // four-byte form
        {"\xc3", false},              // cut short
        {"\xe2\x82", false},          // cut short
        {"\xc0\xaf", false},          // overlong
        {"\xe0\x80\xaf", false},      // overlong
        {"\xed\xa0\x80", false},      // surrogate
        {"\xf4\x90\x80\x80", false},  // past U+10FFFF
        {"\x80", false},              // stray continuation
        {"ok\xc3\x28", false},        // bad continuation
    };
    for (const auto& [bytes, valid] : cases) {
        EXPECT_EQ(QAXLaunchEventHandler::isValidUTF8(bytes), valid)
            << testing::PrintToString(bytes);
    }
}

}  // namespace
}  // namespace qax
