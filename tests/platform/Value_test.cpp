#include <gtest/gtest.h>
#include "telvane/Value.h"
using namespace telvane;
TEST(Value, Placeholder) { EXPECT_EQ(Value(3).integerValue(), 3); }
