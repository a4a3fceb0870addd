#include "session/SessionEnvironment.h"

#include <gtest/gtest.h>

#include "support/SessionTestHarness.h"

using namespace telvane;
using namespace telvane::test;

TEST(SessionEnvironmentTest, SystemDefaultsFillOnlyWhatIsUnset) {
  TestEnvironment test;
  SessionEnvironment given = test.environment();
  SessionEnvironment resolved = given.withSystemDefaults();
  EXPECT_EQ(resolved.settings, test.settings);
  EXPECT_EQ(resolved.clock, test.clock);
  EXPECT_EQ(resolved.random, test.random);
  EXPECT_EQ(resolved.deviceInfo, given.deviceInfo);
  EXPECT_EQ(resolved.internalBuild, false);
  EXPECT_EQ(resolved.frameworkBundleVersion(), "1.2.3");
  EXPECT_EQ(resolved.localeCountryCode(), "DE");
  EXPECT_EQ(resolved.taskMemoryBytes(), 123456u);
  resolved.messageLog("line");
  EXPECT_EQ(test.messageLog->lines(), std::vector<std::string>{"line"});
}

TEST(SessionEnvironmentTest, EmptyEnvironmentGetsEveryPieceAndAFactoryWithoutBackends) {
  SessionEnvironment resolved = SessionEnvironment{}.withSystemDefaults();
  EXPECT_TRUE(resolved.settings);
  EXPECT_TRUE(resolved.deviceInfo);
  EXPECT_TRUE(resolved.random);
  EXPECT_TRUE(resolved.clock);
  EXPECT_TRUE(resolved.internalBuild.has_value());
  EXPECT_TRUE(resolved.frameworkBundleVersion);
  EXPECT_TRUE(resolved.localeCountryCode);
  EXPECT_TRUE(resolved.taskMemoryBytes);
  EXPECT_TRUE(resolved.messageLog);
  ASSERT_TRUE(resolved.backendFactory);
  EXPECT_TRUE(resolved.backendFactory(Value(Dictionary{{"brindle", Value::dictionary()}}), Value(), Value(), "id")
                  .empty());
}
