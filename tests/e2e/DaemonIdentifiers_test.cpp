// The client class's persistent identifiers come from the real daemon's settings, so a
// client sees the values the daemon reports with.
#include <gtest/gtest.h>

#include "e2e/E2eHelpers.h"
#include "platform/SqliteSettingsStore.h"
#include "support/DaemonProcess.h"
#include "support/TempDir.h"
#include "telvane/Telvane.h"

using namespace telvane;
using namespace telvane::test;

TEST(DaemonIdentifiers, TheClientGetsAndRenewsTheDaemonsIdentifiers) {
  TempDir dir;
  DaemonProcess daemon(dir.str());
  ASSERT_TRUE(daemon.start());
  useDaemon(daemon);

  const std::string respect = Telvane::getPersistentIdentifierForDNU(true);
  const std::string override = Telvane::getPersistentIdentifierForDNU(false);
  ASSERT_EQ(respect.size(), 36u) << daemon.log();
  ASSERT_EQ(override.size(), 36u);
  EXPECT_NE(respect, override);
  EXPECT_EQ(Telvane::getPersistentIdentifierForDNU(true), respect) << "kept once made";
  EXPECT_TRUE(daemon.waitForLogLine("getPersistentIdentifierForDNU: The value for uuidRespectDNU: " + respect));
  EXPECT_TRUE(daemon.waitForLogLine("getPersistentIdentifierForDNU: The value for uuidOverrideDNU: " + override));

  const std::string renewed = Telvane::regeneratePersistentIdentifierForDNU(true);
  EXPECT_EQ(renewed.size(), 36u);
  EXPECT_NE(renewed, respect);
  EXPECT_TRUE(daemon.waitForLogLine("regeneratePersistentIdentifierForDNU: Set new value for uuidRespectDNU: " +
                                    renewed));
  EXPECT_EQ(Telvane::getPersistentIdentifierForDNU(true), renewed);
  EXPECT_EQ(Telvane::getPersistentIdentifierForDNU(false), override) << "the other identifier stays";

  // They are the daemon's settings, stored where the daemon keeps its own.
  auto settings = SqliteSettingsStore::open(dir.str() + "/defaults.sqlite3");
  ASSERT_TRUE(settings);
  EXPECT_EQ(settings->read("com.zembra.telvane", "uuidRespectDNU"), std::optional<Value>(Value(renewed)));
  EXPECT_EQ(settings->read("com.zembra.telvane", "uuidOverrideDNU"), std::optional<Value>(Value(override)));
  EXPECT_EQ(daemon.stop(), 0);
}
