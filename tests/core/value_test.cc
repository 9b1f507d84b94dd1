#include "core/value.h"

#include <gtest/gtest.h>

namespace dr {
namespace {

TEST(ValueTest, Placeholder) { EXPECT_TRUE(Value().isAbsent()); }

}  // namespace
}  // namespace dr
