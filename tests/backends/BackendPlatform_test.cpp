#include "backends/BackendPlatform.h"

#include <gtest/gtest.h>

namespace telvane {
namespace {

TEST(BackendPlatformTest, EnvironmentTypeFromSettings) {
  auto settings = makeMemorySettingsStore();
  EXPECT_EQ(environmentTypeFromSettings(*settings, true), 2u);
  EXPECT_EQ(environmentTypeFromSettings(*settings, false), 3u);
  for (std::uint32_t environment : {0u, 1u, 2u, 3u, 4u}) {
    settings->write(kBackendDefaultsDomain, kEnvironmentTypeDefaultsKey, Value(environment));
    EXPECT_EQ(environmentTypeFromSettings(*settings, false), environment);
  }
  settings->write(kBackendDefaultsDomain, kEnvironmentTypeDefaultsKey, Value(7));
  EXPECT_EQ(environmentTypeFromSettings(*settings, false), 2u);
  settings->write(kBackendDefaultsDomain, kEnvironmentTypeDefaultsKey, Value(-1));
  EXPECT_EQ(environmentTypeFromSettings(*settings, false), 2u);
  settings->write(kBackendDefaultsDomain, kEnvironmentTypeDefaultsKey, Value("1"));
  EXPECT_EQ(environmentTypeFromSettings(*settings, false), 1u);
}

TEST(BackendPlatformTest, SystemDefaultsFillOnlyWhatIsMissing) {
  BackendPlatform platform;
  platform.settings = makeMemorySettingsStore();
  platform.internalRelease = false;
  platform.timeZoneOffsetSeconds = [] { return 3600L; };
  BackendPlatform resolved = platform.withSystemDefaults();
  EXPECT_EQ(resolved.settings, platform.settings);
  ASSERT_TRUE(resolved.random);
  ASSERT_TRUE(resolved.clock);
  ASSERT_TRUE(resolved.deviceInfo);
  ASSERT_TRUE(resolved.localeCountryCode);
  EXPECT_EQ(resolved.internalRelease, std::optional<bool>(false));
  EXPECT_EQ(resolved.timeZoneOffsetSeconds(), 3600L);
  // Consent is the diagnostics domain's "SubmitDiagnostics"; absent means none.
  EXPECT_FALSE(resolved.diagnosticsConsent());
  platform.settings->write(kDiagnosticsDefaultsDomain, kSubmitDiagnosticsDefaultsKey, Value(true));
  EXPECT_TRUE(resolved.diagnosticsConsent());
  // The environment is read from the same settings, afresh each time.
  EXPECT_EQ(resolved.environmentType(), 3u);
  platform.settings->write(kBackendDefaultsDomain, kEnvironmentTypeDefaultsKey, Value(1));
  EXPECT_EQ(resolved.environmentType(), 1u);
}

}  // namespace
}  // namespace telvane
