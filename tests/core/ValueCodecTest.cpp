#include <gtest/gtest.h>

#include "core/JsonCodec.h"
#include "core/PlistCodec.h"

namespace qax {
namespace {

TEST(ValueCodec, Placeholder) { EXPECT_TRUE(parseJson("{}")); }

}  // namespace
}  // namespace qax
