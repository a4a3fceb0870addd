#include <gtest/gtest.h>
TEST(Util, Placeholder) { SUCCEED(); }
